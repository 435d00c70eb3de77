// Shared libraries loaded at run time.
#include <dlfcn.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "common/platform/hsv.h"
#include "common/platform/hsv_internal.h"

namespace {

void keepError(char* dst, size_t cap, const char* fallback) {
  const char* e = dlerror();
  snprintf(dst, cap, "%s", e ? e : fallback);
}

}  // namespace

HSVSharedLib::HSVSharedLib() = default;

HSVSharedLib::~HSVSharedLib() { unload(); }

hsvRC HSVSharedLib::load(const char* name, int option) {
  err_[0] = '\0';
  if (!name || !*name) return ECF_INVALID_ARGUMENT;
  // Loading over a loaded library would lose its handle and leak it.
  if (handle_) return ECF_ALREADY_EXISTS;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_LIB_LOAD)) {
    errno_ = ENOENT;
    snprintf(err_, sizeof err_, "%s: library not loaded", name);
    return f;
  }
  int flags = option == 4 ? (RTLD_LAZY | RTLD_LOCAL) : (RTLD_NOW | RTLD_LOCAL);
  dlerror();
  errno = 0;
  void* h = dlopen(name, flags);
  if (!h) {
    // The loader does not set errno reliably: a path is checked for the
    // file itself; a file that is there but does not load is no library.
    int err = errno;
    if (strchr(name, '/')) err = access(name, F_OK) != 0 ? errno : (err ? err : ENOEXEC);
    errno_ = err ? err : ENOENT;
    keepError(err_, sizeof err_, "library not loaded");
    return ECF_NOT_FOUND;
  }
  errno_ = 0;
  handle_ = h;
  return ECF_OK;
}

void* HSVSharedLib::getFuncAddress(const char* symbol) {
  void* p = nullptr;
  getFuncAddress(symbol, &p);
  return p;
}

hsvRC HSVSharedLib::getFuncAddress(const char* symbol, void** address) {
  *address = nullptr;
  if (!handle_) return ECF_NOT_ATTACHED;
  if (!symbol || !*symbol) return ECF_INVALID_ARGUMENT;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_LIB_SYMBOL)) {
    snprintf(err_, sizeof err_, "%s: symbol not found", symbol);
    return f;
  }
  dlerror();
  *address = dlsym(handle_, symbol);
  if (*address) return ECF_OK;
  keepError(err_, sizeof err_, "symbol not found");
  return ECF_NOT_FOUND;
}

hsvRC HSVSharedLib::unload() {
  if (!handle_) return ECF_NOT_ATTACHED;
  void* h = handle_;
  handle_ = nullptr;
  dlerror();
  if (dlclose(h) != 0) {
    keepError(err_, sizeof err_, "library not unloaded");
    return ECF_SYSTEM_ERROR;
  }
  return ECF_OK;
}

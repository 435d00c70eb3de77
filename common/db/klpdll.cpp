// Run-time loading of client libraries through the platform layer.
#include "common/db/klpdll.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>

#include "common/msg/klplog.h"
#include "common/trace/trace.h"

namespace {

constexpr int kTrcComp = 11;
constexpr int kFnLoadLib = 93;

std::string candidateNames(const klpDLL* dll) {
  std::string names;
  for (uint16_t i = 0; i < dll->candidateCount; ++i) {
    if (i) names += ", ";
    names += dll->candidates[i].fileName ? dll->candidates[i].fileName : "";
  }
  return names;
}

void resolveFunctions(klpDLL* dll, const std::bitset<256>& optional) {
  const klpDLLCandidate& loaded = dll->candidates[dll->state];
  for (uint16_t i = 0; i < dll->functionCount; ++i) {
    klpDLLFunc& f = dll->functions[i];
    std::string symbol = std::string(f.name) + (loaded.suffix ? loaded.suffix : "");
    hsvRC rc = dll->library.getFuncAddress(symbol.c_str(), &f.slot);
    if (rc == ECF_OK || (i < optional.size() && optional[i])) continue;
    char code[16];
    snprintf(code, sizeof code, "0x%X", rc);
    logKlpMsg(617, "klpdll::loadLib", KLP_DEST_SEVERITY, symbol.c_str(), nullptr, 3,
              loaded.fileName, code, ecfErrorGetDescription(rc));
  }
}

}  // namespace

klpDLL::klpDLL(const char* name_, const klpDLLCandidate* candidates_, uint16_t candidateCount_,
               klpDLLFunc* functions_, uint16_t functionCount_)
    : name(name_),
      candidateCount(candidateCount_),
      candidates(candidates_),
      functionCount(functionCount_),
      functions(functions_) {
  for (uint16_t i = 0; i < functionCount && i < optional_.size(); ++i)
    optional_[i] = functions[i].slot == KLPDLL_OPTIONAL;
}

klpDLL::~klpDLL() {
  if (!(state & KLPDLL_NOT_LOADED)) {
    hsvRC rc = library.unload();
    if (rc != ECF_OK) logInternalError("klpDLL::~klpDLL", static_cast<int>(rc), "HSVE:lib::unload",
                                       name);
  }
}

int klpdll::loadLib(klpDLL* dll) {
  trcEntry(kTrcComp, kFnLoadLib);
  std::lock_guard<std::mutex> guard(dll->lock_);
  std::string errors;
  hsvRC lastCode = ECF_OK;
  while ((dll->state & KLPDLL_NOT_LOADED) && dll->tried_ < dll->candidateCount) {
    uint16_t i = dll->tried_++;
    const char* file = dll->candidates[i].fileName;
    hsvRC rc = dll->library.load(file, 4);
    if (rc == ECF_OK) {
      dll->state = i;
      logKlpMsg(606, "klpdll::loadLib", KLP_DEST_SEVERITY, file, nullptr, 0);
      break;
    }
    lastCode = rc;
    int err = dll->library.lastErrno();
    errors += err == ENOEXEC ? std::string("ENOEXEC") : std::to_string(err);
    if (dll->tried_ < dll->candidateCount) errors += ",";
  }
  int result = 0;
  if (dll->state & KLPDLL_NOT_LOADED) {
    if (dll->state & KLPDLL_FAILURE_REPORTED) {
      dll->state |= KLPDLL_FAILURE_SEEN_AGAIN;
    } else {
      dll->state |= KLPDLL_FAILURE_REPORTED;
      char first[160];
      snprintf(first, sizeof first, "HSVe return code 0x%X with description %s", lastCode,
               ecfErrorGetDescription(lastCode));
      std::string names = candidateNames(dll);
      logKlpMsg(616, "klpdll::loadLib", KLP_DEST_SEVERITY, first, nullptr, 2, names.c_str(),
                errors.c_str());
      result = KLPDLL_RC_NOT_LOADED;
    }
  } else {
    resolveFunctions(dll, dll->optional_);
  }
  trcExitRc(kTrcComp, kFnLoadLib, result);
  return result;
}

void klpdll::reportLibs(const klpDLL* dll, const char* origin, const char* text) {
  std::string names = candidateNames(dll);
  logKlpMsg(615, origin, KLP_DEST_SEVERITY, origin, nullptr, 2, text, names.c_str());
}

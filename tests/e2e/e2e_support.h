// End-to-end helpers: a sample server under the test's TMPDIR, and a raw client putting any bytes on its queue.
#pragma once

#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <cstring>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "common/ipc/ipcmsg.h"
#include "common/platform/hsv.h"
#include "tests/testing/klptest.h"

namespace e2e {

using Ints = std::vector<int32_t>;
using klptest::waitFor;

inline std::string serverQueuePath(const klptest::TmpDir& dir, const std::string& server) {
  return dir.path() + server + ".KLP.KCAP.IPC";
}
inline std::string replyQueuePath(const klptest::TmpDir& dir, const std::string& server, int pid) {
  return serverQueuePath(dir, server) + ".CMD" + std::to_string(pid);
}
inline std::string logPath(const klptest::TmpDir& dir, const std::string& server) {
  return dir.path() + server + ".KLP.KCAP.log";
}

// Creates (or attaches to) the queue at path; false when that fails.
inline bool openQueue(HSVHIPCQueue& q, const std::string& path, bool create) {
  HSVResID id;
  if (hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id) != ECF_OK) return false;
  return (create ? q.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION) : q.attach(id)) == ECF_OK;
}

// One klpkcap process serving `name` in the directory, logging there.
class Server {
 public:
  Server(const klptest::TmpDir& dir, const std::string& name, const std::vector<std::string>& extraArgs = {},
         const std::vector<std::string>& env = {})
      : dir_(dir), name_(name) {
    std::vector<std::string> argv = {klptest::binPath("klpkcap"), "CAPTURE_SERVER=" + name,
                                     "CAPTURE_PATH=" + dir.path()};
    argv.insert(argv.end(), extraArgs.begin(), extraArgs.end());
    proc_ = std::make_unique<klptest::Background>(argv, env);
  }
  // One a failed test left running is asked to stop, so that it removes its queue.
  ~Server() {
    if (!proc_->running()) return;
    proc_->kill(SIGCONT);
    proc_->kill(SIGTERM);
    proc_->wait(15000);
  }
  // True once the receiving queue exists; false when the server ended first.
  bool ready() {
    return waitFor([&] { return klptest::queueExists(queue()) || !proc_->running(); }, 20000) && proc_->running();
  }
  std::string queue() const { return serverQueuePath(dir_, name_); }
  std::string log() const { return klptest::readFile(logPath(dir_, name_)); }
  klptest::Background& proc() { return *proc_; }
  int pid() const { return proc_->pid(); }
 private:
  const klptest::TmpDir& dir_;
  std::string name_;
  std::unique_ptr<klptest::Background> proc_;
};

struct Reply {
  IpcMsg header{};
  std::vector<char> payload;
};

// Takes one message from q, waiting at most timeoutMs.
inline bool takeReply(HSVHIPCQueue& q, Reply* out, int timeoutMs) {
  char buf[HSV_MAX_MSG_SIZE];
  size_t got = 0;
  if (q.waitForMessage(timeoutMs) != ECF_OK || q.get(buf, sizeof buf, &got, 1000) != ECF_OK ||
      got < IPC_HEADER_SIZE)
    return false;
  memcpy(&out->header, buf, IPC_HEADER_SIZE);
  out->payload.assign(buf + IPC_HEADER_SIZE, buf + got);
  return true;
}

// A client speaking the channel byte by byte; its reply queue "<server queue>.CMD<pid>" lives with it.
class RawClient {
 public:
  explicit RawClient(const std::string& serverQueue, bool withReply = true) {
    ok_ = openQueue(server_, serverQueue, false) &&
          (!withReply || openQueue(reply_, serverQueue + ".CMD" + std::to_string(getpid()), true));
  }
  ~RawClient() {
    if (reply_.isOpen()) reply_.destroy();
    if (server_.isOpen()) server_.detach();
  }
  bool ok() const { return ok_; }
  bool sendBytes(const std::vector<char>& m) { return server_.put(m.data(), m.size()) == ECF_OK; }
  // A well-formed request; payload (when given) goes with its NUL.
  static std::vector<char> request(int32_t func, int32_t subFunc = 0, const std::string* payload = nullptr,
                                   int32_t senderPid = getpid()) {
    size_t len = IPC_HEADER_SIZE + (payload ? payload->size() + 1 : 0);
    std::vector<char> m(len, 0);
    const int32_t words[] = {1, static_cast<int32_t>(len), func, subFunc, senderPid};
    memcpy(m.data(), "IPC:", 4);
    memcpy(m.data() + 8, words, sizeof words);
    if (payload) memcpy(m.data() + IPC_HEADER_SIZE, payload->c_str(), payload->size() + 1);
    return m;
  }
  bool receive(Reply* out) { return takeReply(reply_, out, 10000); }
  bool ask(int32_t func, Reply* out) { return sendBytes(request(func)) && receive(out); }
 private:
  HSVHIPCQueue server_, reply_;
  bool ok_ = false;
};

inline int32_t rd32(const std::vector<char>& p, size_t at) {
  int32_t v = 0;
  if (at + 4 <= p.size()) memcpy(&v, p.data() + at, 4);
  return v;
}

inline size_t countOf(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
  return n;
}

}  // namespace e2e

// Helpers of the end-to-end tests: a sample server under the test's own
// TMPDIR, a raw command-channel client that can put any bytes on the
// server's queue, and readers of the replies.
#pragma once

#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <cstring>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "common/ipc/ipcmsg.h"
#include "common/platform/hsv.h"
#include "tests/testing/klptest.h"

namespace e2e {

inline std::string serverQueuePath(const klptest::TmpDir& dir, const std::string& server) {
  return dir.path() + server + ".KLP.KCAP.IPC";
}
inline std::string replyQueuePath(const klptest::TmpDir& dir, const std::string& server, int pid) {
  return serverQueuePath(dir, server) + ".CMD" + std::to_string(pid);
}
inline std::string logPath(const klptest::TmpDir& dir, const std::string& server) {
  return dir.path() + server + ".KLP.KCAP.log";
}

// Polls cond every 10 ms for at most timeoutMs.
template <typename F>
bool waitFor(F cond, int timeoutMs) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  while (!cond()) {
    if (std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return true;
}

// Removes a queue a killed process left behind.
inline void destroyQueue(const std::string& path) {
  HSVResID id;
  if (hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id) != ECF_OK) return;
  HSVHIPCQueue q;
  if (q.attach(id) == ECF_OK) q.destroy();
}

// One klpkcap process serving `name` in the directory's TMPDIR, logging there.
class Server {
 public:
  Server(const klptest::TmpDir& dir, const std::string& name,
         const std::vector<std::string>& extraArgs = {})
      : dir_(dir), name_(name) {
    std::vector<std::string> argv = {klptest::binPath("klpkcap"), "CAPTURE_SERVER=" + name,
                                     "CAPTURE_PATH=" + dir.path()};
    argv.insert(argv.end(), extraArgs.begin(), extraArgs.end());
    proc_ = std::make_unique<klptest::Background>(argv);
  }
  // A server a failed test left running is asked to stop, so that it
  // removes its queue; only one that does not react is killed.
  ~Server() {
    if (proc_->running()) {
      proc_->kill(SIGCONT);
      proc_->kill(SIGTERM);
      proc_->wait(15000);
    }
  }
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  // True once the receiving queue exists.
  bool ready(int timeoutMs = 20000) {
    return waitFor([&] { return klptest::queueExists(queue()) || !proc_->running(); },
                   timeoutMs) &&
           proc_->running();
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
  std::vector<char> raw;
};

// A client that speaks the channel byte by byte: its reply queue is
// "<server queue>.CMD<this process id>", made on construction and destroyed
// on destruction.
class RawClient {
 public:
  explicit RawClient(const std::string& serverQueue) : serverPath_(serverQueue) {
    replyPath_ = serverQueue + ".CMD" + std::to_string(getpid());
    HSVResID sid, rid;
    ok_ = hsvIPCGetQueResID(serverQueue.c_str(), HSV_QUEUE_RESID_OPTION, &sid) == ECF_OK &&
          server_.attach(sid) == ECF_OK &&
          hsvIPCGetQueResID(replyPath_.c_str(), HSV_QUEUE_RESID_OPTION, &rid) == ECF_OK &&
          reply_.create(rid, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION) == ECF_OK;
  }
  ~RawClient() {
    if (reply_.isOpen()) reply_.destroy();
    if (server_.isOpen()) server_.detach();
  }
  bool ok() const { return ok_; }
  const std::string& replyPath() const { return replyPath_; }

  bool sendBytes(const void* data, size_t len) { return server_.put(data, len) == ECF_OK; }

  // A well-formed request; payload (when given) goes with its NUL.
  static std::vector<char> request(int32_t func, int32_t subFunc, const std::string* payload,
                                   int32_t senderPid = getpid()) {
    size_t len = IPC_HEADER_SIZE + (payload ? payload->size() + 1 : 0);
    std::vector<char> m(len, 0);
    IpcMsg h{};
    memcpy(h.eyeCatcher, "IPC:", 4);
    h.msgVersion = 1;
    h.msgLength = static_cast<int32_t>(len);
    h.func = func;
    h.subFunc = subFunc;
    h.senderPid = senderPid;
    memcpy(m.data(), &h, sizeof h);
    if (payload) memcpy(m.data() + IPC_HEADER_SIZE, payload->c_str(), payload->size() + 1);
    return m;
  }
  bool send(int32_t func, int32_t subFunc = 0, const std::string* payload = nullptr) {
    auto m = request(func, subFunc, payload);
    return sendBytes(m.data(), m.size());
  }

  // Takes one reply, waiting at most timeoutMs.
  bool receive(Reply* out, int timeoutMs = 10000) {
    if (reply_.waitForMessage(timeoutMs) != ECF_OK) return false;
    char buf[HSV_MAX_MSG_SIZE];
    size_t got = 0;
    if (reply_.get(buf, sizeof buf, &got, 1000) != ECF_OK || got < IPC_HEADER_SIZE) return false;
    memcpy(&out->header, buf, IPC_HEADER_SIZE);
    out->raw.assign(buf, buf + got);
    out->payload.assign(buf + IPC_HEADER_SIZE, buf + got);
    return true;
  }
  // Sends and takes the answer.
  bool ask(int32_t func, Reply* out, int32_t subFunc = 0, const std::string* payload = nullptr) {
    return send(func, subFunc, payload) && receive(out);
  }

 private:
  std::string serverPath_, replyPath_;
  HSVHIPCQueue server_, reply_;
  bool ok_ = false;
};

inline int32_t rd32(const std::vector<char>& p, size_t at) {
  int32_t v = 0;
  if (at + 4 <= p.size()) memcpy(&v, p.data() + at, 4);
  return v;
}
inline uint16_t rd16(const std::vector<char>& p, size_t at) {
  uint16_t v = 0;
  if (at + 2 <= p.size()) memcpy(&v, p.data() + at, 2);
  return v;
}

// Thread records of a STATUS reply: name -> state.
inline std::map<std::string, int32_t> threadStates(const Reply& r) {
  std::map<std::string, int32_t> out;
  int32_t n = rd32(r.payload, 8);
  for (int32_t i = 0; i < n; ++i) {
    size_t at = IPC_STATUS_HEADER + IPC_STATUS_RECORD * static_cast<size_t>(i);
    if (at + IPC_STATUS_RECORD > r.payload.size()) break;
    std::string name(r.payload.data() + at, strnlen(r.payload.data() + at, IPC_STATUS_NAME));
    out[name] = rd32(r.payload, at + IPC_STATUS_NAME);
  }
  return out;
}

struct QueryValue {
  std::string value;
  int source = -1;
};
// Records of a parameter query message: name -> (value, source).
inline std::map<std::string, QueryValue> queryRecords(const std::vector<char>& p) {
  std::map<std::string, QueryValue> out;
  if (p.size() < 10) return out;
  uint16_t count = rd16(p, 0);
  size_t at = 10;
  for (uint16_t i = 0; i < count && at + 40 <= p.size(); ++i) {
    uint16_t recLen = rd16(p, at);
    uint16_t nameLen = rd16(p, at + 4);
    uint16_t valueLen = rd16(p, at + 38);
    if (nameLen > 32 || at + 40 + valueLen > p.size() || recLen < 40) break;
    QueryValue v;
    v.source = rd16(p, at + 2);
    v.value.assign(p.data() + at + 40, valueLen);
    out[std::string(p.data() + at + 6, nameLen)] = v;
    at += recLen;
  }
  return out;
}

inline size_t countOf(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
  return n;
}

}  // namespace e2e

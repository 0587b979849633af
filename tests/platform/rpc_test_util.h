#pragma once
// Shared by the RPC host and secli tests: a temporary device root, an
// in-process server that serves a FakeSecureElement over the real sockets,
// and raw frames for what a proxy would never send.
#include <hidl/HidlTransportSupport.h>
#include <host/rpc_host.h>
#include <host/rpc_wire.h>

#include <poll.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <future>
#include <string>
#include <thread>

#include "fake_secure_element.h"
#include "test_root.h"

namespace fake {

using TempRoot = se_test::TestRoot;

// Registers `se` under `name` with a pool of `threads` (the joining thread
// being one of them) and joins the pool on its own thread.
class Server {
 public:
  Server(const sp<FakeSecureElement>& se, const std::string& name, size_t threads) : mSe(se) {
    ::android::hardware::configureRpcThreadpool(threads, true);
    mStatus = se->registerAsService(name);
    std::promise<void> left;
    mJoinerLeft = left.get_future();
    mJoiner = std::thread([p = std::move(left)]() mutable {
      ::android::hardware::joinRpcThreadpool();
      p.set_value();
    });
  }
  ~Server() { stop(); }
  void stop() {
    if (mSe != nullptr) mSe->release(1000);  // no call may stay blocked
    if (!mJoiner.joinable()) return;
    // A joiner that comes late starts the pool again after a shutdown; shut
    // down until it has left.
    do {
      ::android::host::shutdownRpcHostForTest();
    } while (mJoinerLeft.wait_for(std::chrono::milliseconds(100)) != std::future_status::ready);
    mJoiner.join();
  }
  ::android::status_t status() const { return mStatus; }

 private:
  sp<FakeSecureElement> mSe;
  ::android::status_t mStatus;
  std::future<void> mJoinerLeft;
  std::thread mJoiner;
};

// A bare connection to the instance `name`'s socket, or -1.
inline int connectRaw(const std::string& name) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::string path = ::android::host::serviceSocketPath(name);
  strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

// One whole frame as it goes over the socket.
inline std::vector<uint8_t> frameBytes(::android::host::rpc::FrameKind kind, uint32_t id,
                                       uint32_t object, uint32_t code, std::vector<uint8_t> body) {
  ::android::host::rpc::Frame f;
  f.kind = kind;
  f.id = id;
  f.object = object;
  f.code = code;
  f.body = std::move(body);
  std::vector<uint8_t> out;
  if (!::android::host::rpc::encodeFrame(f, &out)) out.clear();
  return out;
}

// Sends `call` (one whole frame) to the socket at `path` from a child
// process, which exits once an answer has come. Returns the child's pid when
// it got one, else -1.
inline pid_t callFromChild(const std::string& path, const std::vector<uint8_t>& call) {
  // Everything the child needs is made before the fork: this process runs
  // the host's threads, so the child keeps to plain system calls.
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
  pid_t pid = fork();
  if (pid < 0) return -1;
  if (pid == 0) {
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    if (fd < 0 || connect(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof(addr)) != 0 ||
        send(fd, call.data(), call.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(call.size())) {
      _exit(2);
    }
    char buf[64];
    pollfd pfd{fd, POLLIN, 0};
    _exit(poll(&pfd, 1, 10000) == 1 && recv(fd, buf, sizeof(buf), 0) > 0 ? 0 : 3);
  }
  int status = 0;
  if (waitpid(pid, &status, 0) != pid || !WIFEXITED(status) || WEXITSTATUS(status) != 0) return -1;
  return pid;
}

}  // namespace fake

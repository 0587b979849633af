#pragma once
// Shared by the RPC host and secli tests: a temporary device root and an
// in-process server that serves a FakeSecureElement over the real sockets.
#include <hidl/HidlTransportSupport.h>
#include <host/rpc_host.h>

#include <poll.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <thread>

#include "fake_secure_element.h"

namespace fake {

class TempRoot {
 public:
  TempRoot() {
    char tmpl[] = "/tmp/se-test-XXXXXX";
    const char* dir = mkdtemp(tmpl);
    mPath = dir ? dir : "";
    setenv("SE_DEVICE_ROOT", mPath.c_str(), 1);
  }
  ~TempRoot() {
    std::error_code ec;
    if (!mPath.empty()) std::filesystem::remove_all(mPath, ec);
  }
  const std::string& path() const { return mPath; }

 private:
  std::string mPath;
};

// Registers `se` under `name` with a pool of `threads` (the joining thread
// being one of them) and joins the pool on its own thread.
class Server {
 public:
  Server(const sp<FakeSecureElement>& se, const std::string& name, size_t threads) : mSe(se) {
    ::android::hardware::configureRpcThreadpool(threads, true);
    mStatus = se->registerAsService(name);
    mJoiner = std::thread([] { ::android::hardware::joinRpcThreadpool(); });
  }
  ~Server() { stop(); }
  void stop() {
    if (mSe != nullptr) mSe->release(1000);  // no call may stay blocked
    ::android::host::shutdownRpcHostForTest();
    if (mJoiner.joinable()) mJoiner.join();
  }
  ::android::status_t status() const { return mStatus; }

 private:
  sp<FakeSecureElement> mSe;
  ::android::status_t mStatus;
  std::thread mJoiner;
};

// Reads one byte from `fd`, waiting at most the test limit.
inline int readByte(int fd) {
  pollfd pfd{fd, POLLIN, 0};
  if (poll(&pfd, 1, 10000) != 1) return -1;
  unsigned char b;
  return read(fd, &b, 1) == 1 ? b : -1;
}

}  // namespace fake

#pragma once
// Within the RPC host: descriptors, frame writes, socket paths and the small
// helpers that the server side, the pool and the client share.
#include "rpc_internal.h"

#include <android/log.h>

#include <sys/un.h>
#include <unistd.h>

#include <cstdint>
#include <string>
#include <vector>

#define RPC_LOGE(...) __android_log_print(ANDROID_LOG_ERROR, kLogTag, __VA_ARGS__)

namespace android {
namespace host {
namespace rpc {

using hidl::base::V1_0::IBase;

// A peer that accepts no bytes of a reply for this long is dropped.
constexpr int kWriteStallMs = 10000;
// A client that does not answer a call on its callback object within this
// long is taken for dead: its connection is dropped and its death notices
// run, so that it cannot hold a pool thread. Healthy clients answer in
// microseconds.
constexpr int kCallbackAnswerMs = 5000;
// kCallbackAnswerMs, unless a test has set another limit
// (setCallbackAnswerLimitForTest in host/rpc_host.h).
int callbackAnswerLimitMs();

class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : mFd(fd) {}
  ~UniqueFd() { reset(); }
  UniqueFd(UniqueFd&& o) noexcept : mFd(o.release()) {}
  UniqueFd& operator=(UniqueFd&& o) noexcept {
    if (this != &o) reset(o.release());
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  int get() const { return mFd; }
  int release() {
    int fd = mFd;
    mFd = -1;
    return fd;
  }
  void reset(int fd = -1) {
    if (mFd >= 0) close(mFd);
    mFd = fd;
  }

 private:
  int mFd = -1;
};

int64_t nowMs();

// Milliseconds left until `deadline` (< 0: none) for poll().
int remainingMs(int64_t deadline);

// Writes all of `data`, waiting while the socket is full; gives up after
// stallMs (< 0: never) without progress.
bool writeAll(int fd, const std::vector<uint8_t>& data, int stallMs);

bool sendFrame(int fd, const Frame& f, int stallMs);

Frame errorFrame(uint32_t id, const std::string& text);

// The outcome of a call as carried by its answering frame.
hardware::Status statusOfAnswer(Frame& answer, std::vector<uint8_t>* reply);

struct DeathLink {
  sp<hardware::hidl_death_recipient> recipient;
  uint64_t cookie;
  wp<IBase> who;
  uint64_t whoSerial;  // the key: `who`'s address may be reused once it is freed
};

bool validServiceName(const std::string& name);

bool fillAddress(const std::string& path, sockaddr_un* addr);

bool makeDirs(const std::string& dir);

// A connected socket to `path`, or -1 with the reason in *error.
int connectTo(const std::string& path, std::string* error);

}  // namespace rpc
}  // namespace host
}  // namespace android

#include "ese_library_gate.h"

#include <errno.h>
#include <time.h>

#include <log/log.h>

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {

namespace {

constexpr const char* kTag = "qvese@1.0-service";

// While the front's lock is held outside the library, a waiter looks again
// this often, so that it notices when the holder enters a call that hangs.
constexpr std::chrono::milliseconds kLockRecheck{100};

long long millis(LibraryGate::Clock::duration d) {
  return static_cast<long long>(std::chrono::duration_cast<std::chrono::milliseconds>(d).count());
}

// The mutex wait takes a wall-clock deadline; only the distance to it counts.
struct timespec wallDeadlineIn(LibraryGate::Clock::duration d) {
  if (d < LibraryGate::Clock::duration::zero()) d = LibraryGate::Clock::duration::zero();
  struct timespec ts;
  clock_gettime(CLOCK_REALTIME, &ts);
  const long long ns = std::chrono::duration_cast<std::chrono::nanoseconds>(d).count();
  ts.tv_sec += static_cast<time_t>(ns / 1000000000LL);
  ts.tv_nsec += static_cast<long>(ns % 1000000000LL);
  if (ts.tv_nsec >= 1000000000L) {
    ts.tv_sec += 1;
    ts.tv_nsec -= 1000000000L;
  }
  return ts;
}

}  // namespace

LibraryGate::LibraryGate(Clock::duration stuckAfter) : bound_(stuckAfter) {}

bool LibraryGate::stuck(Clock::time_point now) const { return busy_ && now - since_ >= bound_; }

void LibraryGate::giveUp(const char* op, Clock::time_point now) const {
  __android_log_print(ANDROID_LOG_ERROR, kTag,
                      "%s: the eSE library has not returned for %lld ms, giving up", op,
                      millis(now - since_));
}

bool LibraryGate::enter(const char* op) {
  std::unique_lock<std::mutex> l(mu_);
  ++waiting_;
  for (;;) {
    const Clock::time_point now = Clock::now();
    if (!busy_) break;
    if (stuck(now)) {
      giveUp(op, now);
      --waiting_;
      return false;
    }
    cv_.wait_until(l, since_ + bound_);
  }
  --waiting_;
  busy_ = true;
  since_ = Clock::now();
  return true;
}

void LibraryGate::leave() {
  std::unique_lock<std::mutex> l(mu_);
  while (owed_ != nullptr) {
    const Action action = owed_;
    const char* by = owedBy_;
    owed_ = nullptr;
    since_ = Clock::now();
    l.unlock();
    __android_log_print(ANDROID_LOG_INFO, kTag, "%s: the deferred library call runs now", by);
    action();
    l.lock();
  }
  busy_ = false;
  cv_.notify_all();
}

bool LibraryGate::runOrLeave(Action action, const char* op) {
  {
    std::lock_guard<std::mutex> l(mu_);
    if (busy_) {
      // One pending action covers any number of requests for it.
      if (owed_ == nullptr) {
        owed_ = action;
        owedBy_ = op;
      }
      __android_log_print(ANDROID_LOG_ERROR, kTag,
                          "%s: the eSE library is in a call for %lld ms, deferred until it returns",
                          op, millis(Clock::now() - since_));
      return false;
    }
    busy_ = true;
    since_ = Clock::now();
  }
  action();
  leave();
  return true;
}

bool LibraryGate::lock(pthread_mutex_t* mutex, const char* op) {
  {
    std::lock_guard<std::mutex> l(mu_);
    ++waiting_;
  }
  bool taken = false;
  for (;;) {
    Clock::duration wait;
    {
      std::lock_guard<std::mutex> l(mu_);
      const Clock::time_point now = Clock::now();
      if (stuck(now)) {
        giveUp(op, now);
        break;
      }
      wait = busy_ ? since_ + bound_ - now : Clock::duration(kLockRecheck);
    }
    const struct timespec deadline = wallDeadlineIn(wait);
    const int rc = pthread_mutex_timedlock(mutex, &deadline);
    if (rc == 0) {
      taken = true;
      break;
    }
    if (rc != ETIMEDOUT) {
      __android_log_print(ANDROID_LOG_ERROR, kTag, "%s: lock failed (%d)", op, rc);
      break;
    }
  }
  std::lock_guard<std::mutex> l(mu_);
  --waiting_;
  return taken;
}

size_t LibraryGate::waiting() const {
  std::lock_guard<std::mutex> l(mu_);
  return waiting_;
}

}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

#pragma once
// Keeps a vendor library call that never returns from taking every RPC thread.
//
// The vendor eSE library is closed code, and a call into it can hang (a wedged
// bus, a firmware fault). The RPC pool has two threads for both instances, so
// eSE callers that wait behind a hung call would soon leave "SIM1" without a
// thread. The gate lets one library call run at a time and keeps the time its
// current call began. Whoever waits for the library, or for the eSE front's
// lock while the holder is in the library, waits as long as the library makes
// progress: it gives up once the call in the library has been running for
// the bound, and an arrival that finds such a call gives up at once. Calls
// that each return within the bound are all served, however many queue up.
#include <pthread.h>

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <mutex>

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {

class LibraryGate {
 public:
  using Clock = std::chrono::steady_clock;
  using Action = void (*)();

  explicit LibraryGate(Clock::duration stuckAfter);
  LibraryGate(const LibraryGate&) = delete;
  LibraryGate& operator=(const LibraryGate&) = delete;

  // Waits until no other call is in the library, then counts the caller's
  // call as the one in it. False, after an error line naming `op`, when the
  // call in the library has been there for the bound.
  bool enter(const char* op);
  // Ends the caller's call. An action left for this moment runs first, on
  // this thread, as a call of its own.
  void leave();

  // Runs `action` as a library call when the library is free; when a call is
  // in it, leaves the action to that call's thread, which runs it as soon as
  // its call returns. Never waits. True when it ran here.
  bool runOrLeave(Action action, const char* op);

  // Takes `mutex`, a lock whose holders make library calls through this gate.
  // False, after an error line naming `op`, when the holder's call has been
  // in the library for the bound, so the caller would wait for a call that
  // may never return.
  bool lock(pthread_mutex_t* mutex, const char* op);

  // Callers inside enter() or lock() right now.
  size_t waiting() const;

 private:
  bool stuck(Clock::time_point now) const;
  void giveUp(const char* op, Clock::time_point now) const;

  const Clock::duration bound_;
  mutable std::mutex mu_;
  std::condition_variable cv_;
  bool busy_ = false;
  Clock::time_point since_;
  Action owed_ = nullptr;
  const char* owedBy_ = "";
  size_t waiting_ = 0;
};

}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

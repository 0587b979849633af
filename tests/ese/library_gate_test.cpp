// The gate in front of the vendor library, with bounds chosen per test: a
// bound no test reaches where callers must wait and be served, a bound of
// nothing where any call in the library counts as stuck. Giving up on a
// stuck call and the deferred close are pinned through the front.
#include <gtest/gtest.h>

#include <pthread.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>
#include <vector>

#include <host/log_capture.h>

#include "ese_library_gate.h"

namespace {

using ::android::hardware::secure_element::V1_0::implementation::LibraryGate;
using std::chrono::minutes;

constexpr auto kGenerous = std::chrono::seconds(20);
const LibraryGate::Clock::duration kNothing = LibraryGate::Clock::duration::zero();

// Waits, without a clock, until `n` callers are inside the gate's waits.
bool waitUntilWaiting(const LibraryGate& gate, size_t n) {
  const auto until = std::chrono::steady_clock::now() + kGenerous;
  while (gate.waiting() < n) {
    if (std::chrono::steady_clock::now() > until) return false;
    std::this_thread::yield();
  }
  return true;
}

class PlainMutex {
 public:
  PlainMutex() { pthread_mutex_init(&m_, nullptr); }
  ~PlainMutex() { pthread_mutex_destroy(&m_); }
  pthread_mutex_t* get() { return &m_; }

 private:
  pthread_mutex_t m_;
};

TEST(LibraryGate, CallersQueuedBehindACallThatReturnsAreAllServedOneAtATime) {
  LibraryGate gate(minutes(10));
  ASSERT_TRUE(gate.enter("holder"));
  std::atomic<int> inside{0};
  std::atomic<int> most{0};
  std::vector<std::future<bool>> callers;
  for (int i = 0; i < 4; ++i) {
    callers.push_back(std::async(std::launch::async, [&] {
      if (!gate.enter("caller")) return false;
      const int now = ++inside;
      int seen = most.load();
      while (now > seen && !most.compare_exchange_weak(seen, now)) {
      }
      --inside;
      gate.leave();
      return true;
    }));
  }
  ASSERT_TRUE(waitUntilWaiting(gate, 4));
  gate.leave();
  for (auto& c : callers) EXPECT_TRUE(c.get());
  EXPECT_EQ(most.load(), 1);
  EXPECT_EQ(gate.waiting(), 0u);
}

TEST(LibraryGate, TheFrontLockIsWaitedForUnlessItsHolderIsStuckInTheLibrary) {
  LibraryGate gate(kNothing);
  PlainMutex front;

  // Held outside the library: however small the bound, the caller waits.
  pthread_mutex_lock(front.get());
  auto patient = std::async(std::launch::async, [&] {
    const bool taken = gate.lock(front.get(), "patient");
    if (taken) pthread_mutex_unlock(front.get());
    return taken;
  });
  ASSERT_TRUE(waitUntilWaiting(gate, 1));
  pthread_mutex_unlock(front.get());
  EXPECT_TRUE(patient.get());

  // Held by a caller inside the library: the bound applies.
  ::android::host::LogCapture cap;
  pthread_mutex_lock(front.get());
  ASSERT_TRUE(gate.enter("holder"));
  EXPECT_FALSE(gate.lock(front.get(), "transmit"));
  EXPECT_TRUE(cap.contains("transmit: the eSE library has not returned for"));
  gate.leave();
  pthread_mutex_unlock(front.get());
  EXPECT_EQ(gate.waiting(), 0u);
}

}  // namespace

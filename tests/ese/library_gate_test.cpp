// The gate in front of the vendor library, with bounds chosen per test: a
// bound no test reaches where callers must wait and be served, a bound of
// nothing where any call in the library counts as stuck.
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

TEST(LibraryGate, CallersGiveUpOnAStuckCallAndComeBackWhenItReturns) {
  ::android::host::LogCapture cap;
  LibraryGate gate(kNothing);
  ASSERT_TRUE(gate.enter("holder"));
  // One that was waiting and one that arrives later: both give up.
  auto waiter = std::async(std::launch::async, [&] { return gate.enter("waiter"); });
  EXPECT_FALSE(waiter.get());
  EXPECT_FALSE(gate.enter("late"));
  EXPECT_TRUE(cap.contains("waiter: the eSE library has not returned for", "qvese@1.0-service"));
  EXPECT_TRUE(cap.contains("late: the eSE library has not returned for", "qvese@1.0-service"));
  gate.leave();
  EXPECT_TRUE(gate.enter("after"));
  gate.leave();
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

std::atomic<int> g_actionRuns{0};
std::atomic<bool> g_actionSawCallerThread{false};
std::thread::id g_expectedThread;
void countRun() {
  ++g_actionRuns;
  g_actionSawCallerThread = std::this_thread::get_id() == g_expectedThread;
}

TEST(LibraryGate, ALeftActionRunsOnceOnTheThreadLeavingTheLibrary) {
  ::android::host::LogCapture cap;
  LibraryGate gate(minutes(10));
  g_actionRuns = 0;

  // Free: it runs at once, here.
  g_expectedThread = std::this_thread::get_id();
  EXPECT_TRUE(gate.runOrLeave(countRun, "now"));
  EXPECT_EQ(g_actionRuns.load(), 1);
  EXPECT_TRUE(g_actionSawCallerThread.load());

  // Busy: it waits for the call in the library, however often it is asked.
  g_actionRuns = 0;
  std::promise<void> entered;
  std::promise<void> letGo;
  auto inLibrary = std::async(std::launch::async, [&] {
    g_expectedThread = std::this_thread::get_id();
    EXPECT_TRUE(gate.enter("holder"));
    entered.set_value();
    letGo.get_future().wait();
    gate.leave();
  });
  entered.get_future().wait();
  EXPECT_FALSE(gate.runOrLeave(countRun, "later"));
  EXPECT_FALSE(gate.runOrLeave(countRun, "later"));
  EXPECT_EQ(g_actionRuns.load(), 0);

  // A caller that waits meanwhile comes in only after the action.
  auto next = std::async(std::launch::async, [&] {
    const bool in = gate.enter("next");
    const int runsSeen = g_actionRuns.load();
    if (in) gate.leave();
    return in ? runsSeen : -1;
  });
  ASSERT_TRUE(waitUntilWaiting(gate, 1));
  letGo.set_value();
  inLibrary.get();
  EXPECT_EQ(g_actionRuns.load(), 1);
  EXPECT_TRUE(g_actionSawCallerThread.load());
  EXPECT_EQ(next.get(), 1);
  EXPECT_TRUE(cap.contains("later: the eSE library is in a call for"));
  EXPECT_TRUE(cap.contains("later: the deferred library call runs now"));
}

}  // namespace

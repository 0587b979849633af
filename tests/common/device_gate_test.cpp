// The gate both fronts share: admission, waiting while the device makes
// progress, queued cleanups and channel owners.
#include <gtest/gtest.h>

#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <fstream>
#include <future>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <host/log_capture.h>
#include <log/log.h>

#include "se_delay.h"
#include "se_device_gate.h"

namespace {

using Clock = std::chrono::steady_clock;
using Outcome = DeviceGate::Outcome;

std::atomic<int64_t> g_silence{0};
int64_t silence() { return g_silence.load(); }

// Records what ran, in order, for the assertions and for a waiting test.
struct Journal {
  std::mutex m;
  std::condition_variable cv;
  std::vector<std::string> lines;
  void add(const std::string& s) {
    std::lock_guard<std::mutex> g(m);
    lines.push_back(s);
    cv.notify_all();
  }
  bool waitFor(size_t n) {
    std::unique_lock<std::mutex> l(m);
    return cv.wait_for(l, std::chrono::seconds(20), [&] { return lines.size() >= n; });
  }
  std::vector<std::string> all() {
    std::lock_guard<std::mutex> g(m);
    return lines;
  }
};

class Gate : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/tmp/gate-test-XXXXXX";
    root_ = mkdtemp(tmpl);
    setenv("SE_DEVICE_ROOT", root_.c_str(), 1);
    setHang(300);
    g_silence = 0;
    se_delay::setDivisorForTest(20);
  }
  void TearDown() override {
    se_delay::setDivisorForTest(1);
    std::remove((root_ + "/properties").c_str());
    rmdir(root_.c_str());
    unsetenv("SE_DEVICE_ROOT");
  }
  void setHang(int ms) { std::ofstream(root_ + "/properties") << "test.hang_ms=" << ms << "\n"; }

  DeviceGate& gate() { return gate_; }

  Journal journal_;
  pthread_mutex_t lock_ = PTHREAD_MUTEX_INITIALIZER;
  std::atomic<int> refuseCloses_{0};
  DeviceGate gate_{DeviceGate::Config{
      "TEST1", LOG_ID_MAIN, "gate-test", &lock_, 2, "test.hang_ms", silence,
      [this](uint8_t c) {
        if (refuseCloses_.load() > 0) {
          --refuseCloses_;
          journal_.add("refused " + std::to_string(c));
          return Outcome::kRetry;
        }
        journal_.add("close " + std::to_string(c));
        gate_.closed(c);
        return Outcome::kDone;
      }}};
  ::android::host::LogCapture cap_;
  std::string root_;
};

// Holds the device on another thread until told to let go.
struct Holder {
  explicit Holder(DeviceGate& g) {
    std::promise<void> in;
    auto entered = in.get_future();
    done = std::async(std::launch::async, [&g, &in, this] {
      DeviceGate::Pass p = g.enter("holder");
      in.set_value();
      std::unique_lock<std::mutex> l(m);
      cv.wait(l, [this] { return go; });
    });
    entered.wait();
  }
  void letGo() {
    {
      std::lock_guard<std::mutex> g(m);
      go = true;
    }
    cv.notify_all();
    done.wait();
  }
  ~Holder() {
    if (done.valid()) letGo();
  }
  std::mutex m;
  std::condition_variable cv;
  bool go = false;
  std::future<void> done;
};

TEST_F(Gate, AdmitsUpToItsLimitAndCountsNestedCallsOnce) {
  Holder holder(gate());
  auto waiter = std::async(std::launch::async, [this] { return gate().enter("waiter").ok(); });
  while (gate().callers() < 2) std::this_thread::yield();
  // The third caller is refused at once, without waiting for the device.
  const auto t0 = Clock::now();
  EXPECT_FALSE(gate().enter("third").ok());
  EXPECT_LT(Clock::now() - t0, std::chrono::milliseconds(100));
  EXPECT_TRUE(cap_.contains("third, TEST1 busy with 2 callers: call refused"));
  holder.letGo();
  EXPECT_TRUE(waiter.get());

  // One caller's own nested calls do not count again.
  DeviceGate::Pass outer = gate().admit("outer");
  DeviceGate::Pass inner = gate().enter("inner");
  EXPECT_TRUE(inner.ok());
  EXPECT_EQ(gate().callers(), 1u);
}

TEST_F(Gate, AWaiterWaitsWhileTheDeviceAnswersAndGivesUpAtTheHangBound) {
  Holder holder(gate());
  // The device answers (silence below the bound) for longer than the bound:
  // the waiter is still there and is served once the holder lets go.
  g_silence = 100000;
  auto waiter = std::async(std::launch::async, [this] { return gate().enter("patient").ok(); });
  EXPECT_EQ(waiter.wait_for(std::chrono::milliseconds(700)), std::future_status::timeout);
  holder.letGo();
  EXPECT_TRUE(waiter.get());

  // The device stops answering: a waiter gives up once the silence reaches
  // the bound, and a newcomer at once.
  Holder stuck(gate());
  g_silence = 0;
  const auto t0 = Clock::now();
  auto giver = std::async(std::launch::async, [this] { return gate().enter("giver").ok(); });
  g_silence = 350000;
  EXPECT_FALSE(giver.get());
  EXPECT_LT(Clock::now() - t0, std::chrono::seconds(2));
  EXPECT_TRUE(cap_.contains("giver, TEST1 without progress for 350 ms: call given up"));
  EXPECT_FALSE(gate().enter("newcomer").ok());
  // A longer bound, read afresh, makes the same silence acceptable.
  setHang(10000);
  auto later = std::async(std::launch::async, [this] { return gate().enter("later").ok(); });
  EXPECT_EQ(later.wait_for(std::chrono::milliseconds(400)), std::future_status::timeout);
  stuck.letGo();
  EXPECT_TRUE(later.get());
}

TEST_F(Gate, QueuedCleanupsRunBeforeTheNextCallerAndRetryUntilDone) {
  // Free device: run at once.
  gate().defer([this] { journal_.add("now"); return Outcome::kDone; }, "now");
  EXPECT_EQ(journal_.all(), std::vector<std::string>{"now"});

  // Busy device: queued, run as the holder lets go, before a waiter's work.
  {
    Holder holder(gate());
    auto waiter = std::async(std::launch::async, [this] {
      DeviceGate::Pass p = gate().enter("waiter");
      journal_.add("waiter");
    });
    while (gate().callers() < 2) std::this_thread::yield();
    gate().defer([this] { journal_.add("queued"); return Outcome::kDone; }, "queued");
    EXPECT_EQ(journal_.all().size(), 1u);
    holder.letGo();
    waiter.get();
  }
  EXPECT_EQ(journal_.all(), (std::vector<std::string>{"now", "queued", "waiter"}));

  // A cleanup the device refuses is tried again, once a second, until done.
  std::atomic<int> tries{0};
  gate().defer([&] {
    const int n = ++tries;
    journal_.add("try");
    return n < 3 ? Outcome::kRetry : Outcome::kDone;
  }, "stubborn");
  ASSERT_TRUE(journal_.waitFor(6));
  EXPECT_EQ(tries.load(), 3);
  EXPECT_TRUE(cap_.contains("stubborn, TEST1 does not answer: tried again every second"));
}

TEST_F(Gate, AClientsDeathOrDisappearanceClosesOnlyItsChannels) {
  // Two live processes stand for two clients.
  const pid_t a = getpid();
  const pid_t b = getppid();
  gate().opened(1, a);
  gate().opened(2, b);
  gate().opened(3, a);
  gate().clientDied(a);
  EXPECT_EQ(journal_.all(), (std::vector<std::string>{"close 1", "close 3"}));

  // A client that went without a death notice: found gone within a second,
  // with no call to notice it.
  const pid_t child = fork();
  if (child == 0) _exit(0);
  ASSERT_EQ(waitpid(child, nullptr, 0), child);
  gate().opened(4, child);
  ASSERT_TRUE(journal_.waitFor(3));
  EXPECT_EQ(journal_.all(), (std::vector<std::string>{"close 1", "close 3", "close 4"}));

  // A close the device cannot make now is kept until it can.
  refuseCloses_ = 1;
  gate().opened(5, a);
  gate().clientDied(a);
  ASSERT_TRUE(journal_.waitFor(5));
  EXPECT_EQ(journal_.all().back(), "close 5");

  // forgetChannels drops owners and queued channel closes alike.
  gate().forgetChannels();
  gate().clientDied(b);
  EXPECT_EQ(journal_.all().size(), 5u) << ::testing::PrintToString(journal_.all());
}

}  // namespace

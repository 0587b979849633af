// The eSE front's init, death handling and transmit against the scripted
// vendor library, and the rules of its one lock.
#include <gtest/gtest.h>

#include <sys/syscall.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <functional>
#include <future>
#include <thread>

#include <android/log.h>

#include "ese_test_util.h"

using namespace ese_test;

namespace {

using ::android::hidl::base::V1_0::IBase;

class EseLifecycle : public EseFixture {
 protected:
  sp<FakeClient> client = new FakeClient();
};

TEST_F(EseLifecycle, InitOpensTheEseAndReportsOnlyASuccessfulOpen) {
  se->init(nullptr);
  EXPECT_TRUE(fake_ese::calls().empty());
  EXPECT_TRUE(logged(cap, "clientCallback IS NULL", ANDROID_LOG_ERROR));
  se->init(client);
  se->init(client);  // opens again although already open
  fake_ese::setInitOpenResult(-1);
  se->init(client);
  EXPECT_EQ(fake_ese::calls(), (Calls{"status", "open", "status", "open", "status", "open"}));
  EXPECT_EQ(client->connected.load(), 2);
  EXPECT_EQ(client->disconnected.load(), 0);
  // The cookie names the client (here this process), whose death it reports.
  const uint64_t self = static_cast<uint64_t>(getpid());
  EXPECT_EQ(client->linkCookies, (std::vector<uint64_t>{self, self, self}));
  EXPECT_EQ(client->linkRecipients[0].get(), static_cast<hidl_death_recipient*>(se.get()));
  EXPECT_TRUE(logged(cap, "init enter!", ANDROID_LOG_INFO));
  EXPECT_TRUE(logged(cap, "phQvEse_init_open FAIL", ANDROID_LOG_ERROR));
}

TEST_F(EseLifecycle, InitSweepsFlaggedChannelsOneToThreeWhenReadyAndServiceDiedKeepsThem) {
  // Channel 0 flagged too: a card may hand it out, but it is never swept.
  for (uint8_t c : {0, 1, 3}) {
    scriptOpen(c);
    ASSERT_EQ(openLogical(se, kAid, 0).status, Status::SUCCESS);
  }
  fake_ese::clearCalls();
  se->serviceDied(0, ::android::wp<IBase>());
  fake_ese::setReadyStatus(1);  // not ready: nothing closed
  se->init(client);
  fake_ese::setReadyStatus(0);
  fake_ese::queueTransceive({0, {}, 0x90, 0x00});
  // The library fails this close; nothing is owed, as the library's close
  // on the death dropped the channel.
  fake_ese::queueTransceive({-1, {}, 0x00, 0x00});
  se->init(client);
  EXPECT_EQ(fake_ese::calls(), (Calls{"close", "status", "open", "status", closeLine(1), kPowerOff,
                                      closeLine(3), kPowerOff, "open"}));
  EXPECT_TRUE(logged(cap, "serviceDied enter!", ANDROID_LOG_ERROR));
  EXPECT_TRUE(logged(cap, "internalCloseChannel enter!", ANDROID_LOG_INFO));
  EXPECT_TRUE(SecureElement::gate().idle());
  EXPECT_TRUE(sweepFlags(se).empty());
}

TEST_F(EseLifecycle, TransmitRewritesCaseOneAndGetResponseAndPassesTheAnswerOn) {
  struct Row {
    Bytes command;
    const char* sent;  // nullptr: nothing reaches the library
    fake_ese::IpcReply reply;
    Bytes response;
    const char* log = nullptr;  // at error level
    unsigned allocFail = 0;
  };
  const Bytes read{0x00, 0xB0, 0x00, 0x00, 0x02};
  const char* readSent = "ipc 00 B0 00 00 02";
  const std::vector<Row> rows = {
      // Mended: a 4-byte command gets Le 00 appended; its P2 stays P2.
      {{0x00, 0xA4, 0x04, 0x0C}, "ipc 00 A4 04 0C 00", {0, {0x90, 0x00}}, {0x90, 0x00}},
      {{0x80, 0xC0, 0x00, 0x00}, "ipc 80 C0 00 00 00", {0, {0x90, 0x00}}, {0x90, 0x00}},
      // A 5-byte GET RESPONSE keeps only the channel bits of CLA.
      {{0xFF, 0xC0, 0x00, 0x00, 0x10}, "ipc 03 C0 00 00 10", {0, {0x61, 0x10}}, {0x61, 0x10}},
      {{0x81, 0xC0, 0x00, 0x00, 0x01, 0x20}, "ipc 81 C0 00 00 01 20", {0, {1}}, {1}},
      {{0x00, 0xA4, 0x04}, "ipc 00 A4 04", {0, {}}, {}},
      {{}, "ipc ", {0, {0x6F}}, {0x6F}},
      {read, readSent, {-1, {0x6F}}, {0x1F}, "transmit failed!!!"},
      {read, readSent, {-1, {0x6F, 0x00}}, {0x6F, 0x00}, "transmit failed!!!"},
      {read, readSent, {0, Bytes(270, 0x33), 5000}, Bytes(270, 0x33)},
      // Mended: a failed allocation still answers, with 1F.
      {read, nullptr, {}, {0x1F}, "transmit cmdApdu.p_data malloc fail!", 1},
      {read, nullptr, {}, {0x1F}, "transmit rspApdu.p_data malloc fail!", 2},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(fake_ese::hex(row.command) + " " + fake_ese::hex(row.reply.bytes));
    fake_ese::reset();
    cap.clear();
    fake_ese::queueIpc(row.reply);
    setBufferAllocFailureForTest(row.allocFail);
    EXPECT_EQ(transmit(se, row.command), std::make_pair(1, row.response));
    setBufferAllocFailureForTest(0);
    // Nothing but the one exchange: no READY, no power-off.
    EXPECT_EQ(fake_ese::calls(), (row.sent ? Calls{row.sent, "result"} : Calls{"result"}));
    EXPECT_TRUE(!row.log || logged(cap, row.log, ANDROID_LOG_ERROR));
    EXPECT_EQ(logged(cap, "transmit failed!!!", ANDROID_LOG_ERROR), row.reply.rc != 0);
  }
}

// ---- The lock ----

constexpr auto kGenerous = std::chrono::seconds(10);

// Runs `op` on a thread of its own and comes back once the thread has either
// finished or gone to sleep. While the test holds the lock, a thread asleep is
// one waiting for it: nothing else in these operations or the fake sleeps.
class Contender {
 public:
  explicit Contender(std::function<void()> op)
      : done_(std::async(std::launch::async, [this, op] {
          tid_.store(static_cast<pid_t>(syscall(SYS_gettid)));
          op();
        })) {
    while (done_.wait_for(std::chrono::seconds(0)) != std::future_status::ready && !asleep())
      std::this_thread::yield();
  }
  bool finishes() { return done_.wait_for(kGenerous) == std::future_status::ready; }

 private:
  bool asleep() {
    const pid_t tid = tid_.load();
    if (tid == 0) return false;
    std::ifstream stat("/proc/self/task/" + std::to_string(tid) + "/stat");
    std::string line;
    std::getline(stat, line);
    const auto close = line.rfind(')');
    return close != std::string::npos && close + 2 < line.size() && line[close + 2] == 'S';
  }
  std::atomic<pid_t> tid_{0};
  std::future<void> done_;
};

// Holds the eSE lock: a transmit whose result callback, which runs under the
// lock, waits until release() notes "released" in the call log.
class LockHolder {
 public:
  explicit LockHolder(const sp<SecureElement>& se) {
    fake_ese::queueIpc({0, {0x90, 0x00}});
    done_ = std::async(std::launch::async, [this, se] {
      se->transmit(Bytes{0x00, 0xCA, 0x00, 0x00, 0x00}, [this](const hidl_vec<uint8_t>&) {
        entered_.set_value();
        release_.wait();
      });
    });
    entered_.get_future().wait();
  }
  ~LockHolder() { release(); }
  void release() {
    if (!released_) {
      released_ = true;
      fake_ese::note("released");
      go_.set_value();
    }
    done_.wait();
  }

 private:
  std::promise<void> entered_, go_;
  std::shared_future<void> release_ = go_.get_future().share();
  bool released_ = false;
  std::future<void> done_;
};

// Every operation that reaches the library waits for the one holding it; a
// death notice does not wait, its close runs as the holder lets go; presence
// and ATR never reach the library.
TEST_F(EseLifecycle, LibraryCallsWaitForTheHolderDeathNoticesAndTheOthersDoNot) {
  const std::string held = "ipc 00 CA 00 00 00";
  struct Row {
    std::string first;  // the operation's first library call or note
    std::function<void()> op;
    bool returnsWhileHeld;
    bool callsAfterRelease;
  };
  const std::vector<Row> rows = {
      {"ready", [&] { openLogical(se, kAid, 0); }, false, true},
      {"ready", [&] { openBasic(se, kAid, 0); }, false, true},
      {closeLine(1), [&] { se->closeChannel(1); }, false, true},
      {"ipc 00 B0 00 00 01", [&] { transmit(se, {0x00, 0xB0, 0x00, 0x00, 0x01}); }, false, true},
      {"status", [&] { se->init(client); }, false, true},
      {"close", [&] { se->serviceDied(0, ::android::wp<IBase>()); }, true, true},
      {"present", [&] { fake_ese::note(se->isCardPresent() ? "present" : "absent"); }, true, false},
      {"atr", [&] { se->getAtr([](const hidl_vec<uint8_t>& a) { fake_ese::note(a.size() ? "?" : "atr"); }); }, true, false},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.first);
    fake_ese::reset();
    LockHolder holder(se);
    Contender contender(row.op);
    if (row.returnsWhileHeld) {
      EXPECT_TRUE(contender.finishes());
    }
    holder.release();
    ASSERT_TRUE(contender.finishes());
    const Calls calls = fake_ese::calls();
    const auto at = [&](const std::string& line) { return std::find(calls.begin(), calls.end(), line); };
    ASSERT_EQ(calls.front(), held);
    ASSERT_NE(at(row.first), calls.end());
    EXPECT_EQ(at("released") < at(row.first), row.callsAfterRelease);
  }
}

}  // namespace

// The eSE front when the card or the library misbehaves: a channel the front
// cannot serve is closed on the card before it is refused, and a library call
// that does not return holds no other caller for longer than the product's
// bound (half a second), whatever operation that caller runs.
#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <future>

#include <android/log.h>

#include "ese_test_util.h"

namespace {

using namespace ese_test;
using ::android::hardware::hidl_vec;

constexpr int kGenerousMs = 20000;

std::future<void> runAsync(std::function<void()> op) {
  return std::async(std::launch::async, std::move(op));
}

bool finishes(std::future<void>& f, int ms) {
  return f.wait_for(std::chrono::milliseconds(ms)) == std::future_status::ready;
}

// MANAGE CHANNEL close of channel c sent on the basic channel.
std::string basicCloseLine(uint8_t c) {
  return "trx 00 70 80 " + hex2(c) + " lc=0 le_type=0 le=36864 rlen=0";
}

class EseFaults : public EseFixture {
 protected:
  void TearDown() override {
    // A test that failed half-way must not leave a library call blocked.
    fake_ese::releaseBlockedIpc();
    if (holder_.valid()) holder_.wait();
  }
  // A transmit whose library call does not return until released.
  void startStuckTransmit() {
    fake_ese::blockNextIpc();
    fake_ese::queueIpc({0, {0x90, 0x00}});
    holder_ = runAsync([this] { transmit(se, {0x00, 0xCA, 0x00, 0x00, 0x00}); });
    ASSERT_TRUE(fake_ese::waitIpcBlocked(kGenerousMs));
  }
  void releaseStuckTransmit() {
    fake_ese::releaseBlockedIpc();
    ASSERT_TRUE(finishes(holder_, kGenerousMs));
  }
  bool gaveUp(const std::string& op) {
    return cap.contains(op + ": the eSE library has not returned for", "qvese@1.0-service");
  }

  std::future<void> holder_;
};

TEST_F(EseFaults, AChannelAboveThreeIsClosedOnTheCardBeforeItIsRefused) {
  struct Row {
    uint8_t channel;
    fake_ese::TransceiveReply close;
    bool closeFails;
  };
  const Row rows[] = {
      {4, {0, {}, 0x90, 0x00}, false},
      {19, {0, {}, 0x90, 0x00}, false},
      {0xFF, {0, {}, 0x90, 0x00}, false},
      // A close the card refuses or the library fails is logged; the refusal
      // stands either way.
      {5, {0, {}, 0x6A, 0x81}, true},
      {6, {-1, {}, 0x90, 0x00}, true},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(static_cast<int>(row.channel));
    fake_ese::reset();
    cap.clear();
    const Bytes reply = {row.channel, 0x90, 0x00};
    fake_ese::queueIpc({0, reply});
    fake_ese::queueTransceive(row.close);
    const OpenResult r = openLogical(se, kAid, 0x00);
    EXPECT_EQ(r.calls, 1);
    EXPECT_EQ(r.channel, 0xFF);
    EXPECT_EQ(r.status, Status::CHANNEL_NOT_AVAILABLE);
    EXPECT_EQ(r.select, reply);
    EXPECT_EQ(fake_ese::calls(),
              (Calls{"ready", kManageOpen, basicCloseLine(row.channel), "result", kPowerOff}));
    const std::string n = std::to_string(row.channel);
    EXPECT_TRUE(logged(cap, "openLogicalChannel card assigned channel " + n + ", closing it",
                       ANDROID_LOG_ERROR));
    EXPECT_EQ(logged(cap, "openLogicalChannel close of channel " + n + " failed", ANDROID_LOG_ERROR),
              row.closeFails);
  }
  // Nothing was flagged: the next init closes nothing.
  EXPECT_TRUE(sweepFlags(se).empty());
}

// Every operation that takes the lock gives up behind a holder stuck in the
// library, with its usual failure result, and reaches the library not at all.
TEST_F(EseFaults, CallersBehindAStuckLibraryCallGiveUpWithTheirFailureResult) {
  // What an open delivered: result callbacks, channel, status, select response.
  const auto open = [](const OpenResult& r) {
    return std::to_string(r.calls) + " " + hex2(r.channel) + " " + std::to_string(int(r.status)) + " [" +
           fake_ese::hex(r.select) + "]";
  };
  const Bytes read = {0x01, 0xB0, 0x00, 0x00, 0x01};
  struct Row {
    const char* op;
    std::function<std::string()> run;
    std::string result;
    Calls calls = {"ipc 00 CA 00 00 00", "result"};  // the stuck call, then this one's result
  };
  const Row rows[] = {
      {"transmit", [&] { const auto r = transmit(se, read); return std::to_string(r.first) + " " + fake_ese::hex(r.second); }, "1 1F"},
      {"openLogicalChannel", [&] { return open(openLogical(se, kAid, 0)); }, "1 7E 1 []"},
      {"openBasicChannel", [&] { return open(openBasic(se, kAid, 0)); }, "1 00 1 [7E]"},
      {"closeChannel", [&] { return std::to_string(int(Status(se->closeChannel(1)))); }, "1", {"ipc 00 CA 00 00 00"}},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.op);
    fake_ese::reset();
    cap.clear();
    ASSERT_NO_FATAL_FAILURE(startStuckTransmit());
    EXPECT_EQ(row.run(), row.result);
    // It came back while the holder is still inside the library.
    EXPECT_FALSE(finishes(holder_, 0));
    EXPECT_EQ(fake_ese::calls(), row.calls);
    EXPECT_TRUE(gaveUp(row.op));
    ASSERT_NO_FATAL_FAILURE(releaseStuckTransmit());
  }
  // Once the library is back, the operations are served again.
  fake_ese::reset();
  fake_ese::queueIpc({0, {0x55, 0x90, 0x00}});
  EXPECT_EQ(transmit(se, read).second, (Bytes{0x55, 0x90, 0x00}));
}

// init takes no lock, but its library calls would queue behind the stuck one:
// it gives them up and tells the client nothing.
TEST_F(EseFaults, InitDuringAStuckLibraryCallGivesUpAndReportsNoState) {
  sp<FakeClient> client = new FakeClient();
  ASSERT_NO_FATAL_FAILURE(startStuckTransmit());
  se->init(client);
  EXPECT_FALSE(finishes(holder_, 0));
  EXPECT_EQ(client->connected.load(), 0);
  EXPECT_EQ(fake_ese::calls(), (Calls{"ipc 00 CA 00 00 00"}));
  EXPECT_TRUE(gaveUp("phQVNciHal_Get_KORVA_Ready_Status"));
  EXPECT_TRUE(gaveUp("phQvEse_init_open"));
  ASSERT_NO_FATAL_FAILURE(releaseStuckTransmit());

  se->init(client);
  EXPECT_EQ(client->connected.load(), 1);
}

// A death notice does not wait for the stuck call: the close it owes follows
// as soon as that call returns, once however many clients died meanwhile.
TEST_F(EseFaults, ServiceDiedDuringAStuckLibraryCallClosesAfterIt) {
  ASSERT_NO_FATAL_FAILURE(startStuckTransmit());
  const ::android::wp<::android::hidl::base::V1_0::IBase> nobody;
  se->serviceDied(0, nobody);
  se->serviceDied(0, nobody);
  EXPECT_FALSE(finishes(holder_, 0));
  EXPECT_EQ(fake_ese::calls(), (Calls{"ipc 00 CA 00 00 00"}));
  EXPECT_TRUE(cap.contains("serviceDied: the eSE library is in a call for"));

  ASSERT_NO_FATAL_FAILURE(releaseStuckTransmit());
  // The owed close comes before the stuck call's own result is delivered.
  EXPECT_EQ(fake_ese::calls(), (Calls{"ipc 00 CA 00 00 00", "close", "result"}));
  EXPECT_TRUE(cap.contains("serviceDied: the deferred library call runs now"));

  // With the library free, the close is made at once.
  fake_ese::clearCalls();
  se->serviceDied(0, nobody);
  EXPECT_EQ(fake_ese::calls(), (Calls{"close"}));
}

}  // namespace

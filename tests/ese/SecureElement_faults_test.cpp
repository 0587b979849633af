// The eSE front when the card or the library misbehaves: a channel the front
// cannot serve is closed on the card before it is refused, closes the library
// could not make are made later, and callers behind a library call that does
// not return give up at the hang bound, whatever operation they run.
#include <gtest/gtest.h>

#include <stdlib.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
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
  void SetUp() override {
    char tmpl[] = "/tmp/ese-faults-XXXXXX";
    root_ = mkdtemp(tmpl);
    setenv("SE_DEVICE_ROOT", root_.c_str(), 1);
    std::ofstream(root_ + "/properties") << "vendor.secure_element.ese.hang_ms=300\n";
    EseFixture::SetUp();
  }
  void TearDown() override {
    // A test that failed half-way must not leave a library call blocked.
    fake_ese::releaseBlockedIpc();
    if (holder_.valid()) holder_.wait();
    unlink((root_ + "/properties").c_str());
    rmdir(root_.c_str());
    unsetenv("SE_DEVICE_ROOT");
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
    return cap.contains(op + ", eSE1 without progress for", "qvese@1.0-service");
  }

  std::future<void> holder_;
  std::string root_;
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
      // stands either way. The one the library failed is made again as soon
      // as the open has let go of the library.
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
    const bool retried = row.close.rc != 0;
    if (retried) fake_ese::queueTransceive({0, {}, 0x90, 0x00});
    const OpenResult r = openLogical(se, kAid, 0x00);
    EXPECT_EQ(r.calls, 1);
    EXPECT_EQ(r.channel, 0xFF);
    EXPECT_EQ(r.status, Status::CHANNEL_NOT_AVAILABLE);
    EXPECT_EQ(r.select, reply);
    Calls want{"ready", kManageOpen, basicCloseLine(row.channel), "result", kPowerOff};
    if (retried) want.push_back(basicCloseLine(row.channel));
    EXPECT_EQ(fake_ese::calls(), want);
    const std::string n = std::to_string(row.channel);
    EXPECT_TRUE(logged(cap, "openLogicalChannel card assigned channel " + n + ", closing it",
                       ANDROID_LOG_ERROR));
    EXPECT_EQ(logged(cap, "openLogicalChannel close of channel " + n + " failed", ANDROID_LOG_ERROR),
              row.closeFails);
  }
  // Nothing was flagged: the next init closes nothing.
  EXPECT_TRUE(sweepFlags(se).empty());
}

// Every operation gives up behind a holder stuck in the library once the
// stuck call has run for the hang bound, with its usual failure result, and
// reaches the library not at all.
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

// init waits for the library like any caller: behind the stuck call it gives
// up and tells the client nothing; behind a slow one it is served.
TEST_F(EseFaults, InitDuringAStuckLibraryCallGivesUpAndReportsNoState) {
  sp<FakeClient> client = new FakeClient();
  ASSERT_NO_FATAL_FAILURE(startStuckTransmit());
  se->init(client);
  EXPECT_FALSE(finishes(holder_, 0));
  EXPECT_EQ(client->connected.load(), 0);
  EXPECT_EQ(fake_ese::calls(), (Calls{"ipc 00 CA 00 00 00"}));
  EXPECT_TRUE(gaveUp("init"));
  ASSERT_NO_FATAL_FAILURE(releaseStuckTransmit());

  se->init(client);
  EXPECT_EQ(client->connected.load(), 1);
}

// A death notice does not wait for the stuck call: the close it owes follows
// as soon as that call has let go of the library, before any later call.
TEST_F(EseFaults, ServiceDiedDuringAStuckLibraryCallClosesAfterIt) {
  ASSERT_NO_FATAL_FAILURE(startStuckTransmit());
  const ::android::wp<::android::hidl::base::V1_0::IBase> nobody;
  se->serviceDied(0, nobody);
  EXPECT_FALSE(finishes(holder_, 0));
  EXPECT_EQ(fake_ese::calls(), (Calls{"ipc 00 CA 00 00 00"}));
  EXPECT_TRUE(cap.contains("serviceDied, phQvEse_close, eSE1 busy: queued until it is free"));

  ASSERT_NO_FATAL_FAILURE(releaseStuckTransmit());
  EXPECT_EQ(fake_ese::calls(), (Calls{"ipc 00 CA 00 00 00", "result", "close"}));

  // With the library free, the close is made at once.
  fake_ese::clearCalls();
  se->serviceDied(0, nobody);
  EXPECT_EQ(fake_ese::calls(), (Calls{"close"}));
}

}  // namespace

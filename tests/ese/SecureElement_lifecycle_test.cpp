// The eSE front's init, death handling and transmit against the scripted
// vendor library, and the rules of its one lock.
#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <thread>

#include <android/log.h>

#include "ese_test_util.h"

using namespace ese_test;

namespace {

constexpr int kGenerousMs = 5000;
// How long a call that must stay behind the lock is given to show up anyway.
constexpr int kMustNotArriveMs = 300;

class EseLifecycle : public EseFixture {
 protected:
  sp<FakeClient> client = new FakeClient();
};

// ---- init ----

TEST_F(EseLifecycle, InitWithoutCallbackDoesNothing) {
  se->init(nullptr);
  EXPECT_TRUE(fake_ese::calls().empty());
  EXPECT_TRUE(logged(cap, "init enter!", ANDROID_LOG_INFO));
  EXPECT_TRUE(logged(cap, "clientCallback IS NULL", ANDROID_LOG_ERROR));
}

TEST_F(EseLifecycle, InitLinksToDeathOpensTheEseAndReportsConnected) {
  se->init(client);
  EXPECT_EQ(fake_ese::calls(), (Calls{"status", "open"}));
  EXPECT_EQ(client->connected.load(), 1);
  EXPECT_EQ(client->disconnected.load(), 0);
  ASSERT_EQ(client->linkCookies.size(), 1u);
  EXPECT_EQ(client->linkCookies[0], 0u);
  EXPECT_EQ(client->linkRecipients[0].get(),
            static_cast<::android::hardware::hidl_death_recipient*>(se.get()));

  // A second init opens again, even though the eSE is already open.
  fake_ese::clearCalls();
  se->init(client);
  EXPECT_EQ(fake_ese::calls(), (Calls{"status", "open"}));
  EXPECT_EQ(client->connected.load(), 2);
}

TEST_F(EseLifecycle, InitOpenFailureTellsTheClientNothing) {
  fake_ese::setInitOpenResult(-1);
  se->init(client);
  EXPECT_EQ(client->connected.load() + client->disconnected.load(), 0);
  EXPECT_TRUE(logged(cap, "phQvEse_init_open FAIL", ANDROID_LOG_ERROR));
}

TEST_F(EseLifecycle, InitSweepsFlaggedChannelsOneToThreeWhenReady) {
  scriptOpen(1);
  ASSERT_EQ(openLogical(se, kAid, 0).status, Status::SUCCESS);
  scriptOpen(3);
  ASSERT_EQ(openLogical(se, kAid, 0).status, Status::SUCCESS);

  // Not ready: nothing is closed and the flags stay.
  fake_ese::clearCalls();
  fake_ese::setReadyStatus(1);
  se->init(client);
  EXPECT_EQ(fake_ese::calls(), (Calls{"status", "open"}));

  // Ready: 1 then 3, each closed and powered off, then the open.
  fake_ese::clearCalls();
  fake_ese::setReadyStatus(0);
  fake_ese::queueTransceive({0, {}, 0x90, 0x00});
  fake_ese::queueTransceive({-1, {}, 0x00, 0x00});  // a failed close is ignored
  se->init(client);
  EXPECT_EQ(fake_ese::calls(), (Calls{"status", closeLine(1), kPowerOff, closeLine(3), kPowerOff,
                                      "open"}));
  EXPECT_EQ(client->connected.load(), 2);
  EXPECT_TRUE(logged(cap, "internalCloseChannel enter!", ANDROID_LOG_INFO));

  // The flags were cleared by the sweep, the failed close's included.
  fake_ese::clearCalls();
  se->init(client);
  EXPECT_EQ(fake_ese::calls(), (Calls{"status", "open"}));
}

TEST_F(EseLifecycle, ServiceDiedClosesTheEseAndKeepsTheFlags) {
  scriptOpen(2);
  ASSERT_EQ(openLogical(se, kAid, 0).status, Status::SUCCESS);
  fake_ese::clearCalls();
  se->serviceDied(0, ::android::wp<::android::hidl::base::V1_0::IBase>());
  EXPECT_EQ(fake_ese::calls(), (Calls{"close"}));
  EXPECT_TRUE(logged(cap, "serviceDied enter!", ANDROID_LOG_ERROR));

  fake_ese::clearCalls();
  fake_ese::queueTransceive({0, {}, 0x90, 0x00});
  se->init(client);
  EXPECT_EQ(fake_ese::calls(), (Calls{"status", closeLine(2), kPowerOff, "open"}));
  EXPECT_EQ(client->connected.load(), 1);
}

TEST_F(EseLifecycle, CardPresentAndEmptyAtrWithoutAskingTheLibrary) {
  fake_ese::setReadyResult(-1);
  EXPECT_TRUE(static_cast<bool>(se->isCardPresent()));
  int atrCalls = 0;
  Bytes atr{0x01};
  se->getAtr([&](const hidl_vec<uint8_t>& v) {
    ++atrCalls;
    atr = v;
  });
  EXPECT_EQ(atrCalls, 1);
  EXPECT_TRUE(atr.empty());
  EXPECT_TRUE(fake_ese::calls().empty());
  EXPECT_TRUE(logged(cap, "isCardPresent enter!", ANDROID_LOG_INFO));
  EXPECT_TRUE(logged(cap, "getAtr enter!", ANDROID_LOG_INFO));
}

// ---- transmit ----

TEST_F(EseLifecycle, TransmitRewritesOnlyCaseOneAndGetResponseCommands) {
  struct Row {
    Bytes in;
    const char* sent;
  };
  const std::vector<Row> rows = {
      // Mended: a 4-byte command gets Le 00 appended; its P2 stays P2.
      {{0x00, 0xA4, 0x04, 0x0C}, "ipc 00 A4 04 0C 00"},
      {{0x80, 0xCA, 0x9F, 0x7F}, "ipc 80 CA 9F 7F 00"},
      // A 4-byte GET RESPONSE keeps its CLA.
      {{0x80, 0xC0, 0x00, 0x00}, "ipc 80 C0 00 00 00"},
      // A 5-byte GET RESPONSE keeps only the channel bits of CLA.
      {{0x81, 0xC0, 0x00, 0x00, 0x20}, "ipc 01 C0 00 00 20"},
      {{0xFF, 0xC0, 0x00, 0x00, 0x10}, "ipc 03 C0 00 00 10"},
      {{0x84, 0xB0, 0x00, 0x00, 0x10}, "ipc 84 B0 00 00 10"},
      {{0x01, 0xD6, 0x00, 0x00, 0x01, 0x55}, "ipc 01 D6 00 00 01 55"},
      {{0x81, 0xC0, 0x00, 0x00, 0x01, 0x20}, "ipc 81 C0 00 00 01 20"},
      {{0x00, 0xA4, 0x04}, "ipc 00 A4 04"},
      {{}, "ipc "},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.sent);
    fake_ese::reset();
    fake_ese::queueIpc({0, {0x90, 0x00}});
    auto r = transmit(se, row.in);
    EXPECT_EQ(r.first, 1);
    EXPECT_EQ(r.second, (Bytes{0x90, 0x00}));
    // No READY, no power-off, nothing but the one exchange.
    EXPECT_EQ(fake_ese::calls(), (Calls{row.sent}));
  }
  EXPECT_TRUE(logged(cap, "transmit enter!", ANDROID_LOG_INFO));
}

TEST_F(EseLifecycle, TransmitResponses) {
  struct Row {
    const char* name;
    fake_ese::IpcReply reply;
    Bytes response;
    bool failedLog;
  };
  const std::vector<Row> rows = {
      {"ok 9000", {0, {0x90, 0x00}}, {0x90, 0x00}, false},
      {"ok 61xx passed as is", {0, {0x01, 0x61, 0x10}}, {0x01, 0x61, 0x10}, false},
      {"ok empty", {0, {}}, {}, false},
      {"ok one byte", {0, {0x6F}}, {0x6F}, false},
      {"failed, nothing back", {-1, {}}, {0x1F}, true},
      {"failed, one byte back", {-1, {0x6F}}, {0x1F}, true},
      {"failed, 6F00 back", {-1, {0x6F, 0x00}}, {0x6F, 0x00}, true},
      {"claims more than the buffer", {0, Bytes(270, 0x33), 5000}, Bytes(270, 0x33), false},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    fake_ese::reset();
    cap.clear();
    fake_ese::queueIpc(row.reply);
    auto r = transmit(se, {0x00, 0xB0, 0x00, 0x00, 0x02});
    EXPECT_EQ(r.first, 1);
    EXPECT_EQ(r.second, row.response);
    EXPECT_EQ(logged(cap, "transmit failed!!!", ANDROID_LOG_ERROR), row.failedLog);
  }
}

TEST_F(EseLifecycle, TransmitAllocationFailuresStillAnswer1F) {
  const std::vector<std::pair<unsigned, const char*>> rows = {
      {1, "transmit cmdApdu.p_data malloc fail!"},
      {2, "transmit rspApdu.p_data malloc fail!"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.first);
    fake_ese::reset();
    setBufferAllocFailureForTest(row.first);
    auto r = transmit(se, {0x00, 0xB0, 0x00, 0x00, 0x02});
    setBufferAllocFailureForTest(0);
    EXPECT_EQ(r.first, 1);
    EXPECT_EQ(r.second, (Bytes{0x1F}));
    EXPECT_TRUE(fake_ese::calls().empty());
    EXPECT_TRUE(logged(cap, row.second, ANDROID_LOG_ERROR));
  }
}

// ---- The lock ----

// Runs `op` on its own thread; the future is ready when it returns.
std::future<void> runAsync(std::function<void()> op) {
  return std::async(std::launch::async, std::move(op));
}

bool finishes(std::future<void>& f, int ms) {
  return f.wait_for(std::chrono::milliseconds(ms)) == std::future_status::ready;
}

TEST_F(EseLifecycle, ChannelOperationsWaitForARunningTransmit) {
  struct Row {
    const char* name;
    std::function<void(const sp<SecureElement>&)> op;
    std::string firstCall;  // the operation's first library call
  };
  const std::vector<Row> rows = {
      {"openLogicalChannel", [](const sp<SecureElement>& s) { openLogical(s, kAid, 0); }, "ready"},
      {"openBasicChannel", [](const sp<SecureElement>& s) { openBasic(s, kAid, 0); }, "ready"},
      {"closeChannel", [](const sp<SecureElement>& s) { s->closeChannel(1); }, closeLine(1)},
      {"transmit", [](const sp<SecureElement>& s) { transmit(s, {0x00, 0xB0, 0x00, 0x00, 0x01}); },
       "ipc 00 B0 00 00 01"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    const std::string& first = row.firstCall;
    fake_ese::reset();
    fake_ese::blockNextIpc();
    fake_ese::queueIpc({0, {0x90, 0x00}});
    auto holder = runAsync([&] { transmit(se, {0x00, 0xCA, 0x00, 0x00, 0x00}); });
    ASSERT_TRUE(fake_ese::waitIpcBlocked(kGenerousMs));

    auto second = runAsync([&] { row.op(se); });
    // While the transmit is inside the library, the other operation must not
    // reach it.
    EXPECT_FALSE(fake_ese::waitForCall(first, kMustNotArriveMs));
    EXPECT_FALSE(finishes(second, 0));
    fake_ese::releaseBlockedIpc();
    ASSERT_TRUE(finishes(holder, kGenerousMs));
    ASSERT_TRUE(finishes(second, kGenerousMs));
    EXPECT_TRUE(fake_ese::waitForCall(first, 0));
  }
}

TEST_F(EseLifecycle, TransmitWaitsForARunningChannelOpen) {
  fake_ese::blockNextIpc();  // the MANAGE CHANNEL open
  fake_ese::queueIpc({0, {0x01, 0x90, 0x00}});
  fake_ese::queueTransceive({0, {}, 0x90, 0x00});
  auto holder = runAsync([&] { openLogical(se, kAid, 0); });
  ASSERT_TRUE(fake_ese::waitIpcBlocked(kGenerousMs));

  auto second = runAsync([&] { transmit(se, {0x01, 0xB0, 0x00, 0x00, 0x01}); });
  EXPECT_FALSE(fake_ese::waitForCall("ipc 01 B0 00 00 01", kMustNotArriveMs));
  fake_ese::releaseBlockedIpc();
  ASSERT_TRUE(finishes(holder, kGenerousMs));
  ASSERT_TRUE(finishes(second, kGenerousMs));
  // The open ran to its end before the transmit began.
  EXPECT_EQ(fake_ese::calls(),
            (Calls{"ready", kManageOpen, selectLine(1, 0), "ipc 01 B0 00 00 01"}));
}

TEST_F(EseLifecycle, InitAndServiceDiedDoNotWaitForTheLock) {
  // Channel 2 flagged, so that init's sweep closes it while the lock is held.
  scriptOpen(2);
  ASSERT_EQ(openLogical(se, kAid, 0).status, Status::SUCCESS);

  fake_ese::clearCalls();
  fake_ese::queueIpc({0, {0x90, 0x00}});
  // The holder keeps the lock in its result callback, out of the library.
  std::promise<void> inCallback;
  std::promise<void> letGo;
  std::shared_future<void> letGoSignal = letGo.get_future().share();
  auto holder = runAsync([&] {
    se->transmit(hidl_vec<uint8_t>(Bytes{0x00, 0xCA, 0x00, 0x00, 0x00}),
                 [&](const hidl_vec<uint8_t>&) {
                   inCallback.set_value();
                   letGoSignal.wait();
                 });
  });
  ASSERT_EQ(inCallback.get_future().wait_for(std::chrono::milliseconds(kGenerousMs)),
            std::future_status::ready);

  fake_ese::queueTransceive({0, {}, 0x90, 0x00});
  auto initCall = runAsync([&] { se->init(client); });
  const bool initDone = finishes(initCall, kGenerousMs);
  auto diedCall = runAsync([&] { se->serviceDied(0, ::android::wp<::android::hidl::base::V1_0::IBase>()); });
  const bool diedDone = finishes(diedCall, kGenerousMs);
  auto presentCall = runAsync([&] { se->isCardPresent(); });
  const bool presentDone = finishes(presentCall, kGenerousMs);

  letGo.set_value();  // before asserting, so nothing is left waiting
  EXPECT_TRUE(initDone);
  EXPECT_TRUE(diedDone);
  EXPECT_TRUE(presentDone);
  ASSERT_TRUE(finishes(holder, kGenerousMs));
  EXPECT_EQ(client->connected.load(), 1);
  EXPECT_EQ(fake_ese::calls(), (Calls{"ipc 00 CA 00 00 00", "status", closeLine(2), kPowerOff,
                                      "open", "close"}));
}

}  // namespace

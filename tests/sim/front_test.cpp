// The SIM front's operations over the real engine and a scripted modem:
// results, channel flags, the init sweep, the lock and the modem per call.
#include <gtest/gtest.h>
#include <host/log_capture.h>
#include <log/log.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>

#include "engine_fixture.h"
#include "fake_uptime.h"
#include "se_device_gate.h"

namespace {

using android::sp;
using android::hardware::hidl_vec;
using android::hardware::Return;
using android::hardware::Void;
using android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using android::hardware::secure_element::V1_0::LogicalChannelResponse;
using android::hardware::secure_element::V1_0::SecureElementStatus;
using android::hardware::secure_element::V1_0::implementation::ZerbSimSecureElement;
using android::host::LogCapture;
using sim_test::FakeModem;
using sim_test::finalLine;
using sim_test::okLine;
using sim_test::scriptOf;
using sim_test::waitUntil;

constexpr const char* kTag = "ZerbSimSecureElement";
using Bytes = std::vector<uint8_t>;

struct StateCallback : public ISecureElementHalCallback {
  Return<void> onStateChange(bool connected) override {
    states.push_back(connected);
    return Void();
  }
  std::vector<bool> states;  // called on the caller's thread, inside init
};

struct OpenResult {
  SecureElementStatus status = SecureElementStatus::UNSUPPORTED_OPERATION;
  uint8_t channel = 0xEE;
  Bytes select;
};

class Front : public sim_test::EngineTest {
 protected:
  void SetUp() override {
    EngineTest::SetUp();
    se_ = sp<ZerbSimSecureElement>::make(0);
  }
  void TearDown() override {
    EngineTest::TearDown();
    sim_test::setUptime(1000);
  }
  void initAndWait(int modems = 1) {
    sp<StateCallback> callback = sp<StateCallback>::make();
    se_->init(callback);
    ASSERT_EQ(std::vector<bool>{true}, callback->states);
    for (int m = 0; m < modems; m++) ASSERT_TRUE(waitUntil([m] { return atPortOpened[m] == 1; }));
  }
  OpenResult open(const Bytes& aid, uint8_t p2) {
    OpenResult r;
    se_->openLogicalChannel(aid, p2, [&](const LogicalChannelResponse& resp, SecureElementStatus s) {
      r = {s, resp.channelNumber, Bytes(resp.selectResponse.begin(), resp.selectResponse.end())};
    });
    return r;
  }
  Bytes transmit(const Bytes& apdu) {
    Bytes out = {0xEE};
    se_->transmit(apdu, [&](const hidl_vec<uint8_t>& resp) { out.assign(resp.begin(), resp.end()); });
    return out;
  }
  Bytes atr() {
    Bytes out = {0xEE};
    se_->getAtr([&](const hidl_vec<uint8_t>& resp) { out.assign(resp.begin(), resp.end()); });
    return out;
  }
  SecureElementStatus close(uint8_t channel) { return se_->closeChannel(channel); }

  sp<ZerbSimSecureElement> se_;
};

TEST_F(Front, OperationsTurnAnswersIntoResults) {
  initAndWait();
  modem0_->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,1,0")},
                               {"AT^CARDATR", okLine("^CARDATR: \"3B9F\"")},
                               {"AT+CCHO=", okLine("+CCHO: 257")},
                               {"AT+CGLA=257,", okLine("+CGLA: 4,\"9000\"")},
                               {"AT+CSIM=", okLine("+CSIM: 4,\"6A82\"")},
                               {"AT+CCHC=", finalLine("OK")}}));
  EXPECT_TRUE(se_->isCardPresent());
  EXPECT_EQ((Bytes{0x3B, 0x9F}), atr());
  OpenResult r = open({0xA0, 0x00, 0x01}, 0x7F);
  EXPECT_EQ(SecureElementStatus::SUCCESS, r.status);
  EXPECT_EQ(1, r.channel);
  EXPECT_EQ((Bytes{0x90, 0x00}), r.select);
  EXPECT_TRUE(se_->isChannelOpen(1));
  EXPECT_EQ((Bytes{0x6A, 0x82}), transmit({0x00, 0xB0, 0x00, 0x00, 0x02}));
  EXPECT_EQ((Bytes{0x90, 0x00}), transmit({0x01, 0xB0, 0x00, 0x00}));
  // Failures, refused by the push or by the handler, come back empty.
  EXPECT_TRUE(transmit(Bytes(264, 0)).empty());
  EXPECT_TRUE(transmit({0x02, 0xB0, 0x00, 0x00}).empty());  // channel 2 not open

  EXPECT_EQ(SecureElementStatus::SUCCESS, close(1));
  EXPECT_FALSE(se_->isChannelOpen(1));
  EXPECT_EQ("AT+CCHC=257", modem0_->commands().back());
  EXPECT_EQ(SecureElementStatus::FAILED, close(1));
  g_simOpenedChannels[4] = 1;
  EXPECT_EQ(SecureElementStatus::FAILED, close(200));
  EXPECT_TRUE(se_->isChannelOpen(4));
}

TEST_F(Front, OpenLogicalChannelResults) {
  initAndWait();
  struct Case {
    std::string open, select;
    SecureElementStatus status;
    uint8_t channel;
    Bytes selectResponse;
  };
  const Case cases[] = {
      {okLine("+CCHP: 259"), okLine("+CGLA: 6,\"6F9000\""), SecureElementStatus::SUCCESS, 3, {0x6F, 0x90, 0x00}},
      {okLine("+CCHP: 261"), okLine("+CGLA: 3,\"900\""), SecureElementStatus::SUCCESS, 5, {}},
      {finalLine("+CME ERROR: 716"), "", SecureElementStatus::NO_SUCH_ELEMENT_ERROR, 0, {}},
      {finalLine("+CME ERROR: 717"), "", SecureElementStatus::CHANNEL_NOT_AVAILABLE, 0, {}},
      {finalLine("+CME ERROR: 760"), "", SecureElementStatus::IOERROR, 0, {}},
      {finalLine("+CME ERROR: 10"), "", SecureElementStatus::FAILED, 0, {}},
      {finalLine("ERROR"), "", SecureElementStatus::FAILED, 0, {}},
      {okLine("+CCHP: 262"), finalLine("ERROR"), SecureElementStatus::FAILED, 0, {}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.open + c.select);
    modem0_->setScript(scriptOf({{"AT+CCHP=", c.open}, {"AT+CGLA=", c.select}, {"AT+CCHC=", finalLine("OK")}}));
    OpenResult r = open({0xA0, 0x00}, 0x00);
    EXPECT_EQ(c.status, r.status);
    EXPECT_EQ(c.channel, r.channel);
    EXPECT_EQ(c.selectResponse, r.select);
    if (c.channel != 0) {
      EXPECT_TRUE(se_->isChannelOpen(c.channel));
    }
  }
  EXPECT_FALSE(se_->isChannelOpen(6));  // the refused SELECT left no flag
}

// The longest answers the request record holds come back whole: 263 bytes
// of a transmit by +CSIM: or +CGLA:, 262 of a SELECT after the channel byte.
// One byte more is refused, never cut.
TEST_F(Front, LongestModemAnswersWholeOneByteMoreRefused) {
  initAndWait();
  const auto answer = [](size_t n) {
    Bytes b(n);
    for (size_t i = 0; i + 2 < n; i++) b[i] = static_cast<uint8_t>(i);
    b[n - 2] = 0x90;
    b[n - 1] = 0x00;
    return b;
  };
  const auto line = [](const std::string& prefix, const Bytes& b) {
    return okLine(prefix + " " + std::to_string(2 * b.size()) + ",\"" + sim_test::hexOf(b) + "\"");
  };
  modem0_->setScript(scriptOf({{"AT+CCHO=", okLine("+CCHO: 257")}, {"AT+CGLA=257,", okLine("+CGLA: 4,\"9000\"")}}));
  ASSERT_EQ(SecureElementStatus::SUCCESS, open({0xA0, 0x00}, 0x7F).status);
  struct Row {
    const char* command;  // what the modem answers, and with which prefix
    const char* prefix;
    uint8_t cla;
    size_t n;
    bool fits;
  };
  const Row transmits[] = {{"AT+CSIM=", "+CSIM:", 0x00, 263, true}, {"AT+CSIM=", "+CSIM:", 0x00, 264, false},
                           {"AT+CGLA=257,", "+CGLA:", 0x01, 263, true}, {"AT+CGLA=257,", "+CGLA:", 0x01, 264, false}};
  for (const Row& r : transmits) {
    SCOPED_TRACE(r.prefix + std::to_string(r.n));
    modem0_->setScript(scriptOf({{r.command, line(r.prefix, answer(r.n))}}));
    EXPECT_EQ(r.fits ? answer(r.n) : Bytes{}, transmit({r.cla, 0xB0, 0x00, 0x00}));
  }
  const Row selects[] = {{"AT+CGLA=258,", "+CGLA:", 0x00, 262, true}, {"AT+CGLA=258,", "+CGLA:", 0x00, 263, false}};
  for (const Row& r : selects) {
    SCOPED_TRACE("select " + std::to_string(r.n));
    modem0_->setScript(scriptOf({{"AT+CCHO=", okLine("+CCHO: 258")},
                                 {r.command, line(r.prefix, answer(r.n))},
                                 {"AT+CCHC=258", finalLine("OK")}}));
    const OpenResult o = open({0xA0, 0x00}, 0x7F);
    EXPECT_EQ(r.fits ? SecureElementStatus::SUCCESS : SecureElementStatus::FAILED, o.status);
    EXPECT_EQ(r.fits ? answer(r.n) : Bytes{}, o.select);
  }
}

TEST_F(Front, NewInitClosesChannelsThreeToNineteenOnly) {
  initAndWait();
  for (int session : {0x101, 0x102, 0x103, 0x113}) {
    modem0_->setScript(scriptOf({{"AT+CCHP=", okLine("+CCHP: " + std::to_string(session))},
                                 {"AT+CGLA=", okLine("+CGLA: 4,9000")}}));
    ASSERT_EQ(SecureElementStatus::SUCCESS, open({0xA0, 0x00}, 0).status);
  }
  modem0_->setScript(scriptOf({{"AT+CCHC=", finalLine("OK")}}));
  modem0_->clearCommands();
  initAndWait();
  EXPECT_EQ((std::vector<std::string>{"AT+CCHC=259", "AT+CCHC=275"}), modem0_->commands());
  for (uint8_t channel : {1, 2}) EXPECT_TRUE(se_->isChannelOpen(channel)) << int(channel);
  for (uint8_t channel : {3, 19}) EXPECT_FALSE(se_->isChannelOpen(channel)) << int(channel);
}

TEST_F(Front, SettlingDelayAfterBoot) {
  struct Case {
    long uptime;
    bool fails, sleeps;
  };
  // The order matters: once settled, a later init neither reads nor sleeps.
  for (const Case& c : {Case{60, false, true}, Case{-1, true, true}, Case{120, false, false},
                        Case{5, true, false}}) {
    SCOPED_TRACE(c.uptime);
    sim_test::setUptime(c.uptime, c.fails);
    LogCapture cap;
    initAndWait();
    EXPECT_EQ(c.sleeps, cap.contains("init, SLEEP 1.5S", kTag));
  }
}

// Every line of the front goes to the radio buffer under its tag, errors at
// error priority and the rest at debug.
TEST_F(Front, LogLinesHaveTheirPriorityAndBuffer) {
  LogCapture cap;
  for (int given : {7, 1, -1}) EXPECT_EQ(given == 1 ? 1 : 0, sp<ZerbSimSecureElement>::make(given)->modemId());
  se_->init(nullptr);
  initAndWait();
  EXPECT_FALSE(se_->isCardPresent());
  se_->openBasicChannel({0xA0}, 0, [](const hidl_vec<uint8_t>&, SecureElementStatus) {});
  root_.writeFile("properties", "persist.odm.radio.sim_slot_cfg=0\n");
  EXPECT_FALSE(se_->isCardPresent());
  const std::pair<const char*, int> expected[] = {
      {"ZerbSimSecureElement, modemid 7", ANDROID_LOG_DEBUG},
      {"init, clientCallback is NULL", ANDROID_LOG_ERROR},
      {"init, m0 init_at_channel SUCCESS", ANDROID_LOG_DEBUG},
      {"isCardPresent, modem_id: 0", ANDROID_LOG_DEBUG},
      {"openBasicChannel, not allowed open basic channel", ANDROID_LOG_ERROR},
      {"isCardPresent, modem_id error: -1", ANDROID_LOG_ERROR},
  };
  for (const auto& e : expected) {
    std::vector<android::host::LogRecord> found = cap.find(e.first, kTag);
    ASSERT_FALSE(found.empty()) << e.first;
    EXPECT_EQ(e.second, found[0].priority) << e.first;
  }
  for (const android::host::LogRecord& r : cap.find("", kTag)) EXPECT_EQ(LOG_ID_RADIO, r.buffer) << r.text;
}

// A SIM call stuck on a silent modem holds the front's lock. Further SIM
// calls give up with their usual failure once the modem has been silent for
// the hang bound; a close given up is queued and made once the modem is
// free; calls that take no lock answer as always.
TEST_F(Front, SilentModemDoesNotHoldUpOtherCallers) {
  se_delay::setDivisorForTest(1);
  root_.writeFile("properties", "vendor.secure_element.sim.hang_ms=500\n");
  initAndWait();
  std::promise<void> written;
  std::atomic<bool> first{true};
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  modem0_->setScript([&, released](FakeModem& m, const std::string& cmd) {
    if (cmd.rfind("AT+CSIM=", 0) != 0) return m.send(finalLine("OK"));
    if (first.exchange(false)) written.set_value();
    released.wait();  // silent until the test is done
    m.send(okLine("+CSIM: 4,\"9000\""));
  });
  g_simOpenedChannels[5] = 1;
  std::future<Bytes> stuck;
  std::future<SecureElementStatus> lockFree;
  // Released on every way out of the test, so that no failure hangs it.
  std::shared_ptr<void> unstick(nullptr, [&](void*) { release.set_value(); });
  stuck = std::async(std::launch::async, [&] { return transmit({0x00, 0xB0, 0x00, 0x00}); });
  written.get_future().wait();
  ASSERT_TRUE(waitUntil([] { return asyncCmdSilenceMicros() >= 500000; }));

  LogCapture cap;
  // On a thread of its own, so that a call that blocked fails the test
  // instead of hanging it.
  lockFree = std::async(std::launch::async, [&] {
    SecureElementStatus basic = SecureElementStatus::SUCCESS;
    se_->openBasicChannel({0xA0}, 0, [&](const hidl_vec<uint8_t>&, SecureElementStatus s) { basic = s; });
    se_->serviceDied(0, nullptr);
    return basic;
  });
  EXPECT_EQ(std::future_status::ready, lockFree.wait_for(at_test::kGenerous));
  EXPECT_FALSE(cap.contains("openBasicChannel, SIM1 without progress"));
  EXPECT_FALSE(cap.contains("serviceDied, SIM1 without progress"));

  EXPECT_FALSE(se_->isCardPresent());
  EXPECT_TRUE(atr().empty());
  EXPECT_TRUE(transmit({0x00, 0xB0, 0x00, 0x00}).empty());
  EXPECT_EQ(SecureElementStatus::FAILED, open({0xA0, 0x00}, 0).status);
  EXPECT_EQ(SecureElementStatus::FAILED, close(5));
  for (const char* op : {"isCardPresent", "getAtr", "transmit", "openLogicalChannel", "closeChannel"}) {
    std::vector<android::host::LogRecord> lines =
        cap.find(std::string(op) + ", SIM1 without progress for ", kTag);
    ASSERT_EQ(1u, lines.size()) << op;
    EXPECT_EQ(ANDROID_LOG_ERROR, lines[0].priority) << op;
  }
  EXPECT_TRUE(cap.contains("closeChannel 5, SIM1 busy: queued until it is free", kTag));
  EXPECT_EQ(1, g_simOpenedChannels[5]);  // not closed yet, so still flagged
  EXPECT_EQ(1u, modem0_->commands().size());

  unstick.reset();
  EXPECT_EQ(SecureElementStatus::CHANNEL_NOT_AVAILABLE, lockFree.get());
  EXPECT_EQ((Bytes{0x90, 0x00}), stuck.get());
  // The queued close ran as the stuck call let go of the modem.
  EXPECT_EQ(0, g_simOpenedChannels[5]);
  EXPECT_EQ((Bytes{0x90, 0x00}), transmit({0x00, 0xB0, 0x00, 0x00}));
}

// Callers on a working but slow modem (each answer takes 300 ms) all wait
// their turn and get their own answers; one caller more than the front
// admits is refused at once.
TEST_F(Front, ConcurrentCallersOnAWorkingModemAreAllServed) {
  se_delay::setDivisorForTest(1);
  initAndWait();
  modem0_->setScript([](FakeModem& m, const std::string& cmd) {
    std::this_thread::sleep_for(std::chrono::milliseconds(300));  // the modem's own pace
    m.send(okLine("+CSIM: 6,\"" + cmd.substr(cmd.find('"') + 3, 2) + "9000\""));
  });
  std::vector<std::future<Bytes>> calls;
  for (size_t i = 0; i < kCallersPerInstance; i++) {
    calls.push_back(std::async(std::launch::async, [this, i] {
      return transmit({0x00, static_cast<uint8_t>(0x10 + i), 0x00, 0x00});
    }));
  }
  ASSERT_TRUE(waitUntil([] { return ZerbSimSecureElement::gate().callers() == kCallersPerInstance; }));
  LogCapture cap;
  const auto t0 = std::chrono::steady_clock::now();
  EXPECT_TRUE(transmit({0x00, 0x20, 0x00, 0x00}).empty());
  EXPECT_LT(std::chrono::steady_clock::now() - t0, std::chrono::milliseconds(100));
  EXPECT_TRUE(cap.contains("transmit, SIM1 busy with 3 callers: call refused", kTag));
  for (size_t i = 0; i < kCallersPerInstance; i++) {
    EXPECT_EQ((Bytes{static_cast<uint8_t>(0x10 + i), 0x90, 0x00}), calls[i].get());
  }
}

TEST_F(Front, EachCallGoesToTheModemOfTheSwitchedSim) {
  startModem1();
  root_.writeFile("properties", "ro.odm.config.modem_number=2\n");
  for (const char* node : {"nfc_sim_switch", "nfc_card_num", "nfc_wired_ese_type"}) {
    root_.writeFile(std::string("sys/nfc/") + node, "0");
  }
  initAndWait(2);
  modem0_->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,1,0")}}));
  modem1_->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,0,0")}}));
  EXPECT_TRUE(se_->isCardPresent());
  root_.writeFile("sys/nfc/nfc_sim_switch", "2");
  root_.writeFile("sys/nfc/nfc_card_num", "3");
  EXPECT_FALSE(se_->isCardPresent());  // modem 1's card answers "absent"
  root_.appendFile("properties", "persist.odm.radio.sim_slot_cfg=0\n");
  EXPECT_TRUE(se_->isCardPresent());  // no answer from the selection: modem 0
  EXPECT_EQ(2u, modem0_->commands().size());
  EXPECT_EQ(1u, modem1_->commands().size());
}

}  // namespace

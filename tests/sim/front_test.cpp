// The SIM front's operations over the real engine and a scripted modem:
// results, channel flags, the init sweep and the modem chosen per call.
#include <gtest/gtest.h>
#include <host/log_capture.h>
#include <log/log.h>

#include <atomic>
#include <future>
#include <thread>

#include "ZerbSimSecureElement.h"
#include "engine_fixture.h"
#include "fake_uptime.h"

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

struct StateCallback : public ISecureElementHalCallback {
  Return<void> onStateChange(bool connected) override {
    states.push_back(connected);
    return Void();
  }
  std::vector<bool> states;  // called on the caller's thread, inside init
};

struct OpenResult {
  LogicalChannelResponse response;
  SecureElementStatus status = SecureElementStatus::UNSUPPORTED_OPERATION;
  int calls = 0;
};

class Front : public sim_test::EngineTest {
 protected:
  void SetUp() override {
    sim_test::resetFront();
    EngineTest::SetUp();
    se_ = sp<ZerbSimSecureElement>::make(0);
  }
  void TearDown() override {
    EngineTest::TearDown();
    sim_test::resetFront();
    sim_test::setUptime(1000);
  }
  void initAndWait(int modems = 1) {
    callback_ = sp<StateCallback>::make();
    se_->init(callback_);
    ASSERT_EQ(std::vector<bool>{true}, callback_->states);
    for (int m = 0; m < modems; m++) {
      ASSERT_TRUE(waitUntil([m] { return atPortOpened[m] == 1; }));
    }
  }
  OpenResult open(const std::vector<uint8_t>& aid, uint8_t p2) {
    OpenResult r;
    se_->openLogicalChannel(aid, p2, [&](const LogicalChannelResponse& resp, SecureElementStatus s) {
      r.response = resp;
      r.status = s;
      r.calls++;
    });
    return r;
  }
  std::vector<uint8_t> transmit(const std::vector<uint8_t>& apdu) {
    std::vector<uint8_t> out;
    int calls = 0;
    se_->transmit(apdu, [&](const hidl_vec<uint8_t>& resp) {
      out.assign(resp.begin(), resp.end());
      calls++;
    });
    EXPECT_EQ(1, calls);
    return out;
  }
  std::vector<uint8_t> atr() {
    std::vector<uint8_t> out;
    int calls = 0;
    se_->getAtr([&](const hidl_vec<uint8_t>& resp) {
      out.assign(resp.begin(), resp.end());
      calls++;
    });
    EXPECT_EQ(1, calls);
    return out;
  }

  sp<ZerbSimSecureElement> se_;
  sp<StateCallback> callback_;
};

TEST_F(Front, EverythingFailsUntilAnInitWithCallback) {
  LogCapture cap;
  se_->init(nullptr);
  EXPECT_TRUE(cap.contains("init, clientCallback is NULL", kTag));
  EXPECT_EQ(0, asyncCmdInited[0]);

  EXPECT_FALSE(se_->isCardPresent());
  EXPECT_TRUE(atr().empty());
  EXPECT_TRUE(transmit({0x00, 0xA4, 0x04, 0x00}).empty());
  OpenResult r = open({0xA0, 0x00}, 0);
  EXPECT_EQ(1, r.calls);
  EXPECT_EQ(SecureElementStatus::FAILED, r.status);
  EXPECT_EQ(0, r.response.channelNumber);
  EXPECT_EQ(SecureElementStatus::FAILED, static_cast<SecureElementStatus>(se_->closeChannel(1)));
  EXPECT_EQ(5u, cap.find("asyncCmdPush, atPortOpened[0] not open", "QvAtChannel").size());
  EXPECT_TRUE(modem0_->commands().empty());
  EXPECT_TRUE(cap.contains("isCardPresent, modem_id: 0", kTag));
}

TEST_F(Front, OperationsTurnAnswersIntoResults) {
  initAndWait();
  modem0_->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,1,0")},
                               {"AT^CARDATR", okLine("^CARDATR: \"3B9F\"")},
                               {"AT+CCHO=", okLine("+CCHO: 257")},
                               {"AT+CGLA=257,", okLine("+CGLA: 4,\"9000\"")},
                               {"AT+CSIM=", okLine("+CSIM: 4,\"6A82\"")},
                               {"AT+CCHC=", finalLine("OK")}}));
  LogCapture cap;
  EXPECT_TRUE(se_->isCardPresent());
  EXPECT_EQ((std::vector<uint8_t>{0x3B, 0x9F}), atr());
  EXPECT_TRUE(cap.contains("getAtr, now copy data, modem_id: 0", kTag));

  OpenResult r = open({0xA0, 0x00, 0x01}, 0x7F);
  EXPECT_EQ(SecureElementStatus::SUCCESS, r.status);
  EXPECT_EQ(1, r.response.channelNumber);
  EXPECT_EQ((std::vector<uint8_t>{0x90, 0x00}),
            std::vector<uint8_t>(r.response.selectResponse.begin(), r.response.selectResponse.end()));
  EXPECT_EQ(1, g_simOpenedChannels[1]);

  EXPECT_EQ((std::vector<uint8_t>{0x6A, 0x82}), transmit({0x00, 0xB0, 0x00, 0x00, 0x02}));
  EXPECT_EQ((std::vector<uint8_t>{0x90, 0x00}), transmit({0x01, 0xB0, 0x00, 0x00}));

  // Failures, refused by the push or by the handler, come back empty.
  EXPECT_TRUE(transmit(std::vector<uint8_t>(264, 0)).empty());
  EXPECT_TRUE(transmit({0x02, 0xB0, 0x00, 0x00}).empty());  // channel 2 not open

  EXPECT_EQ(SecureElementStatus::SUCCESS, static_cast<SecureElementStatus>(se_->closeChannel(1)));
  EXPECT_EQ(0, g_simOpenedChannels[1]);
  EXPECT_EQ("AT+CCHC=257", modem0_->commands().back());
  // A close of a channel never opened is still sent, and fails.
  EXPECT_EQ(SecureElementStatus::FAILED, static_cast<SecureElementStatus>(se_->closeChannel(1)));
  cap.clear();
  g_simOpenedChannels[4] = 1;
  EXPECT_EQ(SecureElementStatus::FAILED, static_cast<SecureElementStatus>(se_->closeChannel(200)));
  EXPECT_TRUE(cap.contains("request_close_logical_channel, channel 200 is invalid", "QvAtChannel"));
  EXPECT_EQ(1, g_simOpenedChannels[4]);
}

TEST_F(Front, OpenLogicalChannelResults) {
  initAndWait();
  struct Case {
    const char* name;
    std::string open;
    std::string select;
    SecureElementStatus status;
    uint8_t channel;
    std::vector<uint8_t> selectResponse;
    const char* cmeErr = nullptr;  // set when the open itself is refused
  };
  const Case cases[] = {
      {"select response", okLine("+CCHP: 259"), okLine("+CGLA: 6,\"6F9000\""),
       SecureElementStatus::SUCCESS, 3, {0x6F, 0x90, 0x00}},
      {"empty select response", okLine("+CCHP: 260"), okLine("+CGLA: 0,\"\""),
       SecureElementStatus::SUCCESS, 4, {}},
      {"malformed select response", okLine("+CCHP: 261"), okLine("+CGLA: 3,\"900\""),
       SecureElementStatus::SUCCESS, 5, {}},
      {"no such applet", finalLine("+CME ERROR: 716"), "", SecureElementStatus::NO_SUCH_ELEMENT_ERROR,
       0, {}, "716"},
      {"no channel free", finalLine("+CME ERROR: 717"), "", SecureElementStatus::CHANNEL_NOT_AVAILABLE,
       0, {}, "717"},
      {"card error", finalLine("+CME ERROR: 760"), "", SecureElementStatus::IOERROR, 0, {}, "760"},
      {"other modem error", finalLine("+CME ERROR: 10"), "", SecureElementStatus::FAILED, 0, {}, "10"},
      {"plain error", finalLine("ERROR"), "", SecureElementStatus::FAILED, 0, {}, "-1"},
      {"select refused", okLine("+CCHP: 262"), finalLine("ERROR"), SecureElementStatus::FAILED, 0, {}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    modem0_->setScript(scriptOf({{"AT+CCHP=", c.open}, {"AT+CGLA=", c.select},
                                 {"AT+CCHC=", finalLine("OK")}}));
    modem0_->clearCommands();
    LogCapture cap;
    OpenResult r = open({0xA0, 0x00}, 0x00);
    EXPECT_EQ(1, r.calls);
    EXPECT_EQ(c.status, r.status);
    if (c.cmeErr) {
      // A refused open sends no SELECT and has nothing to close.
      EXPECT_EQ(1u, modem0_->commands().size());
      EXPECT_TRUE(cap.contains(std::string("request_open_logical_channel, cme_err: ") + c.cmeErr,
                               "QvAtChannel"));
    }
    EXPECT_EQ(c.channel, r.response.channelNumber);
    EXPECT_EQ(c.selectResponse, std::vector<uint8_t>(r.response.selectResponse.begin(),
                                                     r.response.selectResponse.end()));
    if (c.channel != 0) {
      EXPECT_EQ(1, g_simOpenedChannels[c.channel]);
    }
  }
  EXPECT_EQ(0, g_simOpenedChannels[6]);  // the refused SELECT left no flag
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
  LogCapture cap;
  sp<StateCallback> second = sp<StateCallback>::make();
  se_->init(second);
  EXPECT_EQ((std::vector<std::string>{"AT+CCHC=259", "AT+CCHC=275"}), modem0_->commands());
  EXPECT_EQ(std::vector<bool>{true}, second->states);
  EXPECT_EQ(1, g_simOpenedChannels[1]);
  EXPECT_EQ(1, g_simOpenedChannels[2]);
  EXPECT_EQ(0, g_simOpenedChannels[3]);
  EXPECT_EQ(0, g_simOpenedChannels[19]);
  EXPECT_EQ(2u, cap.find("closeChannel, modem_id: 0", kTag).size());
  // The worker is not started a second time.
  EXPECT_FALSE(cap.contains("asyncCmdInit, devpath", "QvAtChannel"));
}

TEST_F(Front, InitLogsAndSettlingDelay) {
  struct Case {
    long uptime;
    bool fails;
    const char* uptimeLine;  // nullptr: none
    bool sleeps;
    int32_t timeflagAfter;
  };
  const Case cases[] = {
      {60, false, "print_system_boot_time, time is 60", true, -1},
      {-1, true, "Failed to get sysinfo\n", true, -1},
      {120, false, "print_system_boot_time, time is 120", false, 1},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.uptime);
    sim_test::setUptime(c.uptime, c.fails);
    LogCapture cap;
    initAndWait();
    EXPECT_TRUE(cap.contains(c.uptimeLine, kTag));
    EXPECT_EQ(c.sleeps, cap.contains("init, SLEEP 1.5S", kTag));
    EXPECT_EQ(c.timeflagAfter, timeflag);
  }
  // Once settled, a later init neither reads the uptime nor sleeps.
  sim_test::setUptime(5, true);
  LogCapture cap;
  initAndWait();
  EXPECT_FALSE(cap.contains("print_system_boot_time", kTag));
  EXPECT_FALSE(cap.contains("sysinfo", kTag));
  EXPECT_FALSE(cap.contains("SLEEP", kTag));
}

// Every line of the front goes to the radio buffer under its tag, errors at
// error priority and the rest at debug.
TEST_F(Front, LogLinesHaveTheirPriorityAndBuffer) {
  LogCapture cap;
  sp<ZerbSimSecureElement> other = sp<ZerbSimSecureElement>::make(7);
  se_->init(nullptr);
  initAndWait();
  EXPECT_FALSE(se_->isCardPresent());
  se_->openBasicChannel({0xA0}, 0, [](const hidl_vec<uint8_t>&, SecureElementStatus) {});
  se_->serviceDied(0, nullptr);
  root_.writeFile("properties", "persist.odm.radio.sim_slot_cfg=0\n");
  EXPECT_FALSE(se_->isCardPresent());
  const std::vector<std::pair<const char*, int>> expected = {
      {"ZerbSimSecureElement, modemid 7", ANDROID_LOG_DEBUG},
      {"init, clientCallback is NULL", ANDROID_LOG_ERROR},
      {"init, m_modem_id: 0", ANDROID_LOG_DEBUG},
      {"init, dual_sim = 1", ANDROID_LOG_DEBUG},
      {"init, m0 init_at_channel SUCCESS", ANDROID_LOG_DEBUG},
      {"isCardPresent, modem_id: 0", ANDROID_LOG_DEBUG},
      {"openBasicChannel, not allowed open basic channel", ANDROID_LOG_ERROR},
      {"serviceDied, enter, modem_id: 0", ANDROID_LOG_DEBUG},
      {"isCardPresent, modem_id error: -1", ANDROID_LOG_ERROR},
  };
  for (const auto& e : expected) {
    SCOPED_TRACE(e.first);
    std::vector<android::host::LogRecord> found = cap.find(e.first, kTag);
    ASSERT_FALSE(found.empty());
    EXPECT_EQ(e.second, found[0].priority);
  }
  for (const android::host::LogRecord& r : cap.find("", kTag)) {
    EXPECT_EQ(LOG_ID_RADIO, r.buffer) << r.text;
  }
}

// A SIM call stuck on a silent modem holds the front's lock. Further SIM
// calls, and init's sweep, give up at once with their usual failure instead
// of tying up the RPC threads; calls that take no lock answer as always.
TEST_F(Front, SilentModemDoesNotHoldUpOtherCallers) {
  se_delay::setDivisorForTest(1);  // the real silence bound
  initAndWait();
  std::promise<void> written;
  std::atomic<bool> first{true};
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  modem0_->setScript([&, released](FakeModem& m, const std::string& cmd) {
    if (cmd.rfind("AT+CSIM=", 0) == 0) {
      if (first.exchange(false)) written.set_value();
      released.wait();  // silent until the test is done
      m.send(okLine("+CSIM: 4,\"9000\""));
    } else if (cmd.rfind("AT+CCHC=", 0) == 0) {
      m.send(finalLine("OK"));
    }
  });
  g_simOpenedChannels[5] = 1;
  auto stuck = std::async(std::launch::async, [&] { return transmit({0x00, 0xB0, 0x00, 0x00}); });
  written.get_future().wait();
  ASSERT_TRUE(waitUntil([] { return asyncCmdSilenceMicros() >= 500000; }));

  LogCapture cap;
  // Operations that take no lock are not held up at all (on a thread of
  // their own, so that one that blocked fails the test instead of hanging it).
  auto lockFree = std::async(std::launch::async, [&] {
    int basic = 0;
    se_->openBasicChannel({0xA0}, 0, [&](const hidl_vec<uint8_t>&, SecureElementStatus s) {
      basic = s == SecureElementStatus::CHANNEL_NOT_AVAILABLE ? 1 : -1;
    });
    se_->serviceDied(0, nullptr);
    return basic;
  });
  EXPECT_EQ(std::future_status::ready, lockFree.wait_for(at_test::kGenerous));
  EXPECT_FALSE(cap.contains("openBasicChannel, modem silent"));
  EXPECT_FALSE(cap.contains("serviceDied, modem silent"));

  EXPECT_FALSE(se_->isCardPresent());
  EXPECT_TRUE(atr().empty());
  EXPECT_TRUE(transmit({0x00, 0xB0, 0x00, 0x00}).empty());
  OpenResult r = open({0xA0, 0x00}, 0);
  EXPECT_EQ(SecureElementStatus::FAILED, r.status);
  EXPECT_EQ(SecureElementStatus::FAILED, static_cast<SecureElementStatus>(se_->closeChannel(5)));
  sp<StateCallback> second = sp<StateCallback>::make();
  se_->init(second);
  EXPECT_EQ(std::vector<bool>{true}, second->states);
  for (const char* op : {"isCardPresent", "getAtr", "transmit", "openLogicalChannel", "closeChannel", "init"}) {
    SCOPED_TRACE(op);
    std::vector<android::host::LogRecord> lines = cap.find(std::string(op) + ", modem silent for ", kTag);
    ASSERT_EQ(1u, lines.size());
    EXPECT_EQ(ANDROID_LOG_ERROR, lines[0].priority);
  }
  EXPECT_EQ(1, g_simOpenedChannels[5]);  // not closed, so still flagged
  EXPECT_EQ(1u, modem0_->commands().size());

  release.set_value();
  EXPECT_EQ(1, lockFree.get());
  EXPECT_EQ((std::vector<uint8_t>{0x90, 0x00}), stuck.get());
  // The modem answers again: calls are served as before.
  EXPECT_EQ((std::vector<uint8_t>{0x90, 0x00}), transmit({0x00, 0xB0, 0x00, 0x00}));
}

// Several callers on a working but slow modem (each answer takes 100 ms, so
// the last caller waits far longer than the silence bound) all wait their
// turn and get their own answers.
TEST_F(Front, ConcurrentCallersOnAWorkingModemAreAllServed) {
  se_delay::setDivisorForTest(1);
  initAndWait();
  modem0_->setScript([](FakeModem& m, const std::string& cmd) {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));  // the modem's own pace
    const std::string hex = cmd.substr(cmd.find('"') + 1, 4);
    m.send(okLine("+CSIM: 6,\"" + hex.substr(2, 2) + "9000\""));
  });
  constexpr int kCallers = 8;
  LogCapture cap;
  std::vector<std::future<std::vector<uint8_t>>> calls;
  for (int i = 0; i < kCallers; i++) {
    calls.push_back(std::async(std::launch::async, [this, i] {
      return transmit({0x00, static_cast<uint8_t>(0x10 + i), 0x00, 0x00});
    }));
  }
  for (int i = 0; i < kCallers; i++) {
    EXPECT_EQ((std::vector<uint8_t>{static_cast<uint8_t>(0x10 + i), 0x90, 0x00}), calls[i].get());
  }
  EXPECT_FALSE(cap.contains("modem silent"));
}

TEST_F(Front, EachCallGoesToTheModemOfTheSwitchedSim) {
  startModem1();
  root_.writeFile("properties", "ro.odm.config.modem_number=2\n");
  for (const char* node : {"nfc_sim_switch", "nfc_card_num", "nfc_wired_ese_type"}) {
    root_.writeFile(std::string("sys/nfc/") + node, "0");
  }
  LogCapture cap;
  initAndWait(2);
  EXPECT_TRUE(cap.contains("init, dual_sim init second pthread", kTag));
  EXPECT_TRUE(cap.contains("init, m1 init_at_channel SUCCESS", kTag));
  const auto script = scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,1,0")}});
  modem0_->setScript(script);
  modem1_->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,0,0")}}));

  EXPECT_TRUE(se_->isCardPresent());
  EXPECT_EQ(1u, modem0_->commands().size());
  EXPECT_TRUE(modem1_->commands().empty());

  root_.writeFile("sys/nfc/nfc_sim_switch", "2");
  root_.writeFile("sys/nfc/nfc_card_num", "3");
  EXPECT_FALSE(se_->isCardPresent());  // modem 1's card answers "absent"
  EXPECT_EQ(1u, modem0_->commands().size());
  EXPECT_EQ(1u, modem1_->commands().size());
  EXPECT_TRUE(cap.contains("isCardPresent, modem_id: 1", kTag));

  root_.appendFile("properties", "persist.odm.radio.sim_slot_cfg=1,0\n");
  EXPECT_TRUE(se_->isCardPresent());
  EXPECT_EQ(2u, modem0_->commands().size());

  // No answer from the selection: modem 0 with an error line.
  root_.appendFile("properties", "persist.odm.radio.sim_slot_cfg=0\n");
  cap.clear();
  EXPECT_TRUE(se_->isCardPresent());
  EXPECT_TRUE(cap.contains("isCardPresent, modem_id error: -1", kTag));
  EXPECT_EQ(3u, modem0_->commands().size());
}

// The log lines of these are in LogLinesHaveTheirPriorityAndBuffer.
TEST(FrontClass, ConstructorAndBasicChannel) {
  struct Case {
    int given, kept;
  };
  for (const Case& c : {Case{0, 0}, Case{1, 1}, Case{5, 0}, Case{-1, 0}}) {
    EXPECT_EQ(c.kept, sp<ZerbSimSecureElement>::make(c.given)->modemId()) << c.given;
  }
  // Refused before any init, without touching a modem.
  sp<ZerbSimSecureElement> se = sp<ZerbSimSecureElement>::make(1);
  int calls = 0;
  se->openBasicChannel({0xA0, 0x00}, 0x00, [&](const hidl_vec<uint8_t>& resp, SecureElementStatus s) {
    EXPECT_EQ(0u, resp.size());
    EXPECT_EQ(SecureElementStatus::CHANNEL_NOT_AVAILABLE, s);
    calls++;
  });
  EXPECT_EQ(1, calls);
}

}  // namespace

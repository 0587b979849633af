// The request engine and its handlers against a scripted modem on a pty:
// what the worker writes to the port and what lands in g_asyncCmd.
#include <gtest/gtest.h>
#include <host/log_capture.h>
#include <log/log.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>

#include "engine_fixture.h"

namespace {

using android::host::LogCapture;
using sim_test::FakeModem;
using sim_test::finalLine;
using sim_test::hexOf;
using sim_test::okLine;
using sim_test::Replies;
using sim_test::scriptOf;
using sim_test::waitUntil;

constexpr const char* kTag = "QvAtChannel";
const std::vector<uint8_t> kAid = {0xA0, 0x00};

// Answers an open with `session` and the SELECT with `select`.
Replies openReplies(int session, const std::string& select) {
  return {{"AT+CCHO=", okLine("+CCHO: " + std::to_string(session))},
          {"AT+CCHP=", okLine("+CCHP: " + std::to_string(session))},
          {"AT+CGLA=", select},
          {"AT+CCHC=", finalLine("OK")}};
}

// One answer to one request: the result in g_asyncCmd and an expected log.
struct Row {
  std::string reply;
  int32_t param, datalen;
  std::vector<uint8_t> bytes;
  const char* log;
};

class Engine : public sim_test::EngineTest {
 protected:
  void expectRows(const char* command, int32_t request, const std::vector<uint8_t>& data,
                  const std::vector<Row>& rows) {
    for (const Row& r : rows) {
      SCOPED_TRACE(r.reply.substr(0, 40));
      modem0_->setScript(scriptOf({{command, r.reply}}));
      LogCapture cap;
      ASSERT_EQ(0, push(0, request, data, 42));
      EXPECT_EQ(r.param, g_asyncCmd.param);
      EXPECT_EQ(r.datalen, g_asyncCmd.datalen);
      EXPECT_EQ(r.bytes, result());
      if (r.log) {
        EXPECT_TRUE(cap.contains(r.log, kTag)) << r.log;
      }
    }
  }
  int32_t closeOn(int32_t modem, int32_t channel) {
    EXPECT_EQ(0, push(modem, REQUEST_CLOSE_LOGICAL_CHANNEL, {}, channel));
    return g_asyncCmd.param;
  }
};

TEST_F(Engine, PushRefusalsWriteNothing) {
  EXPECT_EQ(-1, push(0, REQUEST_GET_CARD_PRESENT, {}));  // no port yet
  startWorker(0);
  const std::vector<uint8_t> five(5, 0xAA);
  struct Refusal {
    int32_t modem, request;
    const uint8_t* data;
    int32_t len;
  };
  const Refusal refusals[] = {{2, 1, nullptr, 0}, {-1, 1, nullptr, 0},       {1, 1, nullptr, 0},
                              {0, 0, nullptr, 0}, {0, 7, nullptr, 0},        {0, 5, five.data(), 264},
                              {0, 5, five.data(), -1}, {0, 5, nullptr, 5}};
  for (const Refusal& r : refusals) {
    SCOPED_TRACE(::testing::Message() << r.modem << "/" << r.request << "/" << r.len);
    g_asyncCmd.datalen = 77;
    EXPECT_EQ(-1, asyncCmdPush(r.modem, r.request, r.data, r.len));
    EXPECT_EQ(77, g_asyncCmd.datalen);
  }
  EXPECT_TRUE(modem0_->commands().empty());
}

TEST_F(Engine, InitAtChannelStartsOneWorkerPerModem) {
  LogCapture cap;
  EXPECT_EQ(-1, init_at_channel(2));
  EXPECT_EQ(-1, init_at_channel(-1));
  // Two inits at once (the front's init runs without its lock): the 20 ms
  // start pause at full length leaves room for a second start.
  se_delay::setDivisorForTest(1);
  std::atomic<int> failed{0};
  std::thread other([&] { failed += init_at_channel(0) != 0; });
  failed += init_at_channel(0) != 0;
  other.join();
  EXPECT_EQ(0, failed.load());
  EXPECT_EQ(1u, cap.find("cmdloop[0] > Start...", kTag).size());
  EXPECT_EQ(0, asyncCmdInited[1]);
}

// A worker scheduled late (here: 100 ms before its first open, five times
// the start pause) still has its port open when init_at_channel returns, so
// the ready state the front then reports is not followed by refused calls.
TEST_F(Engine, InitAtChannelReturnsAfterTheWorkersFirstTry) {
  se_delay::setDivisorForTest(1);
  sim_test::setBeforeOpen([](const std::string&, int attempt) {
    if (attempt == 1) std::this_thread::sleep_for(std::chrono::milliseconds(100));
  });
  EXPECT_EQ(0, init_at_channel(0));
  EXPECT_EQ(1, atPortOpened[0].load());
}

// A port that comes up only after the six start attempts (a boot race) is
// served once there; until then calls are refused.
TEST_F(Engine, PortThatComesLateIsOpenedOnceThere) {
  se_delay::setDivisorForTest(1000);
  auto late = sim_test::modemAt(root_.at("dev/appvcom34"), /*linkNow=*/false);
  ASSERT_TRUE(late);
  late->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,1,0")}}));
  LogCapture cap;
  ASSERT_EQ(0, init_at_channel(1));
  ASSERT_TRUE(waitUntil([&] { return cap.contains("cmdloop[1] still waiting for the AT port", kTag); }));
  EXPECT_EQ(6u, cap.find("cmdloop[1] open[/dev/appvcom34] fd: -1", kTag).size());
  EXPECT_EQ(-1, push(1, REQUEST_GET_CARD_PRESENT, {}));
  late->link();
  ASSERT_TRUE(waitUntil([] { return atPortOpened[1] == 1; }));
  EXPECT_EQ(0, push(1, REQUEST_GET_CARD_PRESENT, {}));
  EXPECT_EQ(1, g_asyncCmd.param);
}

// A lost port (the modem restarts): requests fail while it is away, the
// channels opened before are gone, and the worker serves the port again.
TEST_F(Engine, LostPortIsReopenedAndItsChannelsAreGone) {
  se_delay::setDivisorForTest(1000);
  startWorker(0);
  modem0_->setScript(scriptOf(openReplies(258, okLine("+CGLA: 4,9000"))));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid));
  ASSERT_EQ(0, g_asyncCmd.param);

  // The port goes away while a SELECT waits: the open fails without a
  // release command, which could not be sent anyway.
  std::promise<void> selectSent;
  modem0_->setScript([&](FakeModem& m, const std::string& cmd) {
    if (cmd.rfind("AT+CCHP=", 0) == 0) m.send(okLine("+CCHP: 259"));
    if (cmd.rfind("AT+CGLA=", 0) == 0) selectSent.set_value();
  });
  LogCapture cap;
  auto open = std::async(std::launch::async, [&] {
    return push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid) == 0 ? g_asyncCmd.param : -100;
  });
  selectSent.get_future().wait();
  modem0_.reset();
  EXPECT_EQ(1, open.get());
  EXPECT_TRUE(cap.contains("transmit_select_cmd:cmd return errno=-3", kTag));
  EXPECT_FALSE(cap.contains("release of modem session"));
  ASSERT_TRUE(waitUntil([&] { return cap.contains("cmdloop[0] AT port lost", kTag); }));
  EXPECT_EQ(-1, push(0, REQUEST_GET_CARD_PRESENT, {}));

  modem0_ = sim_test::modemAt(root_.at("dev/appvcom18"));
  ASSERT_TRUE(modem0_);
  modem0_->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,1,0")}}));
  ASSERT_TRUE(waitUntil([] { return atPortOpened[0] == 1; }));
  EXPECT_EQ(0, push(0, REQUEST_GET_CARD_PRESENT, {}));
  EXPECT_EQ(1, g_asyncCmd.param);
  ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, {0x02, 0xB0, 0x00, 0x00}));
  EXPECT_EQ(1, g_asyncCmd.param);
  EXPECT_TRUE(cap.contains("request_transmit_apdu, channel 2 is not open", kTag));
}

TEST_F(Engine, CardPresence) {
  startWorker(0);
  const char* failed = "request_get_card_present: at_tok_nextint has_g failed\n";
  expectRows("AT^CARDTYPE?", REQUEST_GET_CARD_PRESENT, {},
             {{okLine("^CARDTYPE: 1,1,0"), 1, 0, {}, nullptr},
              {okLine("^CARDTYPE: 2,0,1"), 1, 0, {}, nullptr},
              {okLine("^CARDTYPE: 1,0,0"), 0, 0, {}, nullptr},
              {okLine("^CARDTYPE: 0,1,1"), 0, 0, {}, nullptr},
              {okLine("^CARDTYPE: 1,2147483647,1"), 0, 0, {}, nullptr},  // the sum wraps below 0
              {okLine("^CARDTYPE: 1,1"), 0, 0, {}, failed},
              {finalLine("ERROR"), 0, 0, {}, nullptr}});
}

TEST_F(Engine, Atr) {
  startWorker(0);
  const std::string atr263(526, 'A');
  expectRows("AT^CARDATR", REQUEST_GET_ATR, {},
             {{okLine("^CARDATR: \"3B00\""), 0, 2, {0x3B, 0x00}, nullptr},
              {okLine("^CARDATR: 3b9f"), 0, 2, {0x3B, 0x9F}, nullptr},
              {okLine("^CARDATR: \"\""), 1, 0, {}, nullptr},
              {okLine("^CARDATR: \"3B0\""), 0, -1, {}, nullptr},
              {finalLine("+CME ERROR: 10"), 1, 0, {}, "request_get_atr:cmd return errno="},
              {okLine("^CARDATR"), 1, 0, {}, "request_get_atr:cmd return errno=-6"},
              {okLine("^CARDATR: \"" + atr263 + "\""), 0, 263, std::vector<uint8_t>(263, 0xAA), nullptr},
              // One byte more than the data area holds is refused, never cut.
              {okLine("^CARDATR: \"" + atr263 + "BB\""), 1, 0, {}, "request_get_atr, atr of 528 hex digits"}});
}

// A modem without the vendor queries: presence by AT+CPIN?, no ATR. Each
// row runs on a freshly opened port; `again` is what a second request of the
// same kind sends once the first has learned the modem's answer.
TEST_F(Engine, PresenceAndAtrOnAModemWithoutTheVendorQueries) {
  const std::string cpinReady = okLine("+CPIN: READY");
  struct Case {
    int32_t request;
    Replies replies;
    int32_t param;
    std::vector<std::string> first, again;
    const char* log;
  };
  const std::vector<std::string> presenceProbe = {"AT^CARDTYPE?", "AT+CPIN?"};
  const std::vector<std::string> pinOnly = {"AT+CPIN?"};
  const Case cases[] = {
      // Unknown command, in each form a modem uses; AT+CPIN? answers.
      {REQUEST_GET_CARD_PRESENT, {{"AT+CPIN?", cpinReady}}, 1, presenceProbe, pinOnly,
       "the modem does not know AT^CARDTYPE? (ERROR)"},
      {REQUEST_GET_CARD_PRESENT, {{"AT^", finalLine("+CME ERROR: 4")}, {"AT+CPIN?", okLine("+CPIN: SIM PIN")}},
       1, presenceProbe, pinOnly, "(+CME ERROR: 4)"},
      {REQUEST_GET_CARD_PRESENT,
       {{"AT^", finalLine("+CME ERROR: operation not supported")}, {"AT+CPIN?", cpinReady}}, 1,
       presenceProbe, pinOnly, nullptr},
      {REQUEST_GET_CARD_PRESENT, {{"AT^", finalLine("COMMAND NOT SUPPORT")}, {"AT+CPIN?", cpinReady}}, 1,
       presenceProbe, pinOnly, nullptr},
      // No card, numeric or verbose; any other failure counts as none too.
      {REQUEST_GET_CARD_PRESENT, {{"AT+CPIN?", finalLine("+CME ERROR: 10")}}, 0, presenceProbe, pinOnly,
       nullptr},
      {REQUEST_GET_CARD_PRESENT, {{"AT+CPIN?", finalLine("+CME ERROR: SIM not inserted")}}, 0,
       presenceProbe, pinOnly, nullptr},
      {REQUEST_GET_CARD_PRESENT, {}, 0, presenceProbe, pinOnly, "AT+CPIN? failed (err 0, ERROR)"},
      // A modem that knows the query and says no card: no fallback, asked again.
      {REQUEST_GET_CARD_PRESENT, {{"AT^CARDTYPE?", finalLine("+CME ERROR: 10")}}, 0, {"AT^CARDTYPE?"},
       {"AT^CARDTYPE?"}, nullptr},
      // No ATR query: an empty ATR as the answer (param 0), not asked again.
      // A bare ERROR is taken for that only where the presence query is
      // unknown as well.
      {REQUEST_GET_ATR, {}, 0, {"AT^CARDATR", "AT^CARDTYPE?"}, {},
       "the modem does not know AT^CARDATR (ERROR) and has no other ATR query"},
      {REQUEST_GET_ATR, {{"AT^CARDATR", finalLine("+CME ERROR: 4")}}, 0, {"AT^CARDATR"}, {}, nullptr},
      {REQUEST_GET_ATR, {{"AT^CARDTYPE?", okLine("^CARDTYPE: 0,0,0")}}, 1, {"AT^CARDATR", "AT^CARDTYPE?"},
       {"AT^CARDATR"}, "request_get_atr:cmd return errno=0"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(::testing::Message() << c.request << " " << (c.replies.empty() ? "" : c.replies.back().second));
    startWorker(0);
    modem0_->setScript(scriptOf(c.replies));
    modem0_->clearCommands();
    LogCapture cap;
    ASSERT_EQ(0, push(0, c.request, {}));
    EXPECT_EQ(c.param, g_asyncCmd.param);
    if (c.request == REQUEST_GET_ATR) {
      EXPECT_EQ(0, g_asyncCmd.datalen);
    }
    EXPECT_EQ(c.first, modem0_->commands());
    if (c.log) {
      EXPECT_TRUE(cap.contains(c.log, kTag)) << c.log;
    }
    modem0_->clearCommands();
    ASSERT_EQ(0, push(0, c.request, {}));
    EXPECT_EQ(c.param, g_asyncCmd.param);
    EXPECT_EQ(c.again, modem0_->commands());
    // What was learned is said once per port opening; a port opened again
    // is asked afresh.
    for (const char* query : {"does not know AT^CARDTYPE?", "does not know AT^CARDATR"}) {
      EXPECT_LE(cap.find(query, kTag).size(), 1u) << query;
    }
    asyncCmdStop(0);
  }
  startWorker(0);
  modem0_->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,1,0")}}));
  modem0_->clearCommands();
  ASSERT_EQ(0, push(0, REQUEST_GET_CARD_PRESENT, {}));
  EXPECT_EQ(1, g_asyncCmd.param);
  EXPECT_EQ(std::vector<std::string>{"AT^CARDTYPE?"}, modem0_->commands());
}

TEST_F(Engine, OpenLogicalChannelCommandTexts) {
  startWorker(0);
  const std::vector<uint8_t> aid = {0x01, 0x02, 0x03};
  const std::vector<uint8_t> aid52(52, 0xA0);  // fills the 119-character open command
  struct Case {
    std::vector<uint8_t> aid;
    int32_t p2;
    std::string open, select;
  };
  const Case cases[] = {
      {aid, 0x04, "AT+CCHP=\"010203\",4", "AT+CGLA=259,16,\"00A4040403010203\""},
      {aid, 0x7F, "AT+CCHO=\"010203\"", "AT+CGLA=259,16,\"00A4040003010203\""},
      {aid, 0xFF, "AT+CCHP=\"010203\",255", "AT+CGLA=259,16,\"00A404FF03010203\""},
      {aid52, 200, "AT+CCHP=\"" + hexOf(aid52) + "\",200", "AT+CGLA=259,114,\"00A404C834" + hexOf(aid52) + "\""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.open);
    modem0_->clearCommands();
    modem0_->setScript(scriptOf(openReplies(259, okLine("+CGLA: 4,\"9000\""))));
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, c.aid, c.p2));
    EXPECT_EQ((std::vector<std::string>{c.open, c.select}), modem0_->commands());
    EXPECT_EQ(0, g_asyncCmd.param);
    EXPECT_EQ(2, g_asyncCmd.datalen);
    EXPECT_EQ(3, g_asyncCmd.data[0]);
    EXPECT_EQ((std::vector<uint8_t>{0x90, 0x00}), result(1));
  }
  struct Refused {
    std::vector<uint8_t> aid;
    int32_t p2;
  };
  for (const Refused& r : {Refused{std::vector<uint8_t>(53, 0xA0), 0}, Refused{{}, 0}, Refused{aid, 256},
                           Refused{aid, -1}}) {
    SCOPED_TRACE(::testing::Message() << r.aid.size() << "/" << r.p2);
    modem0_->clearCommands();
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, r.aid, r.p2));
    EXPECT_EQ(1, g_asyncCmd.param);
    EXPECT_TRUE(modem0_->commands().empty());
  }
}

// Modem session ids whose channel part is 0 or above 19 are refused and
// released; ids below 1 name no session, so nothing is released.
TEST_F(Engine, UnusableSessionIdIsReleasedAtTheModem) {
  startWorker(0);
  for (int session : {20, 32, 0x11F, 0, -32}) {
    SCOPED_TRACE(session);
    modem0_->setScript(scriptOf(openReplies(session, okLine("+CGLA: 4,9000"))));
    modem0_->clearCommands();
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid));
    EXPECT_EQ(1, g_asyncCmd.param);
    std::vector<std::string> sent = {"AT+CCHP=\"A000\",0"};
    if (session >= 1) sent.push_back("AT+CCHC=" + std::to_string(session));
    EXPECT_EQ(sent, modem0_->commands());
  }
}

// The modem may answer the open with the session id alone.
TEST_F(Engine, OpenTakesTheBareSessionId) {
  startWorker(0);
  for (int32_t p2 : {0x7F, 0x04}) {
    SCOPED_TRACE(p2);
    modem0_->setScript(scriptOf({{"AT+CCH", okLine("258")}, {"AT+CGLA=258,", okLine("+CGLA: 4,9000")}}));
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid, p2));
    EXPECT_EQ(0, g_asyncCmd.param);
    EXPECT_EQ(2, g_asyncCmd.data[0]);
  }
  modem0_->setScript(scriptOf({{"AT+CCHP=", okLine("25A")}}));  // not a number
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid));
  EXPECT_EQ(1, g_asyncCmd.param);
}

// A SELECT that timed out sends no release at once (the modem did not
// answer one command and would hold the worker a third time-out), but the
// session is not forgotten: it is released once the modem answers again.
TEST_F(Engine, TimedOutSelectReleasesItsSessionOnceTheModemAnswers) {
  se_delay::setDivisorForTest(1000);  // 600 s become 600 ms
  startWorker(0);
  std::atomic<bool> answering{false};
  modem0_->setScript([&](FakeModem& m, const std::string& cmd) {
    if (cmd.rfind("AT+CCHP=", 0) == 0) return m.send(okLine("+CCHP: 257"));
    if (answering) m.send(finalLine("OK"));
  });
  LogCapture cap;
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid));
  EXPECT_EQ(1, g_asyncCmd.param);
  EXPECT_TRUE(cap.contains("transmit_select_cmd:cmd return errno=-4", kTag));
  EXPECT_EQ(0u, modem0_->commands().at(1).rfind("AT+CGLA=257,", 0));
  answering = true;
  ASSERT_TRUE(waitUntil([] { return session_release_count(0) == 0; }));
  EXPECT_EQ("AT+CCHC=257", modem0_->commands().back());
  EXPECT_TRUE(cap.contains("released modem session 257", kTag));
}

// A presence query the modem never answers leaves presence unknown (below
// 0), which the front reports as a failure; an answer of "no card" is 0.
TEST_F(Engine, PresenceIsUnknownWhenTheModemDoesNotAnswer) {
  se_delay::setDivisorForTest(1000);  // 600 s become 600 ms
  startWorker(0);
  modem0_->setScript([](FakeModem&, const std::string&) {});
  ASSERT_EQ(0, push(0, REQUEST_GET_CARD_PRESENT, {}));
  EXPECT_LT(g_asyncCmd.param, 0);
  modem0_->setScript(scriptOf({{"AT^CARDTYPE?", finalLine("+CME ERROR: 10")}}));
  ASSERT_EQ(0, push(0, REQUEST_GET_CARD_PRESENT, {}));
  EXPECT_EQ(0, g_asyncCmd.param);
}

TEST_F(Engine, FailedSelectClosesTheModemChannel) {
  startWorker(0);
  const std::string resp262(524, '1');
  const std::pair<std::string, const char*> cases[] = {
      {finalLine("ERROR"), "transmit_select_cmd:cmd return errno="},
      {okLine("+CGLA: 4"), "transmit_select_cmd: at_tok_nextstr(&p_line, &(response_str)) error\n"},
      {okLine("+CGLA: 526," + resp262 + "11"), "transmit_select_cmd, select response of 526 hex digits"},
      // Without a status word: a length short of the text, or one byte.
      {okLine("+CGLA: 2,\"9000\""), "transmit_select_cmd, length 2 shorter than the 4 hex digits given"},
      {okLine("+CGLA: 2,\"90\""), "transmit_select_cmd, one-byte answer has no status word"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.second);
    modem0_->setScript(scriptOf(openReplies(0x105, c.first)));
    modem0_->clearCommands();
    LogCapture cap;
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid));
    EXPECT_EQ(1, g_asyncCmd.param);
    EXPECT_TRUE(cap.contains(c.second, kTag));
    EXPECT_EQ("AT+CCHC=261", modem0_->commands().back());
    EXPECT_EQ(1, closeOn(0, 5));  // the entry went with the modem's channel
    EXPECT_EQ(3u, modem0_->commands().size());
  }
  // 262 bytes after the channel byte still fit.
  modem0_->setScript(scriptOf(openReplies(0x105, okLine("+CGLA: 524," + resp262))));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid));
  EXPECT_EQ(0, g_asyncCmd.param);
  EXPECT_EQ(std::vector<uint8_t>(262, 0x11), result(1));

  // When the modem refuses the release too, the entry stays for a later close.
  modem0_->setScript(scriptOf({{"AT+CCHP=", okLine("+CCHP: 262")}}));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid));
  EXPECT_EQ("AT+CCHC=262", modem0_->commands().back());
  modem0_->setScript(scriptOf({{"AT+CCHC=", finalLine("OK")}}));
  EXPECT_EQ(0, closeOn(0, 6));
}

TEST_F(Engine, CloseLogicalChannel) {
  startWorker(0);
  modem0_->setScript(scriptOf(openReplies(0x203, okLine("+CGLA: 4,9000"))));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid));
  for (int32_t channel : {0, 20, -1, 200, 4}) EXPECT_EQ(1, closeOn(0, channel)) << channel;
  // A refused close keeps the entry, so it can be tried again.
  modem0_->setScript(scriptOf({{"AT+CCHC=", finalLine("+CME ERROR: 4")}}));
  modem0_->clearCommands();
  EXPECT_EQ(1, closeOn(0, 3));
  modem0_->setScript(scriptOf({{"AT+CCHC=", finalLine("OK")}}));
  EXPECT_EQ(0, closeOn(0, 3));
  EXPECT_EQ(1, closeOn(0, 3));
  EXPECT_EQ((std::vector<std::string>{"AT+CCHC=515", "AT+CCHC=515"}), modem0_->commands());
}

TEST_F(Engine, TransmitCommandTextsAndChannels) {
  startWorker(0);
  for (int session : {0x103, 0x107, 0x109, 0x113}) {  // channels 3, 7, 9, 19
    modem0_->setScript(scriptOf(openReplies(session, okLine("+CGLA: 4,9000"))));
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid));
  }
  modem0_->setScript(scriptOf({{"AT+CSIM=", okLine("+CSIM: 4,\"6A82\"")},
                               {"AT+CGLA=", okLine("+CGLA: 4,\"9000\"")}}));
  std::vector<uint8_t> apdu263(263, 0x5A);
  apdu263[0] = 0x4F;
  const std::pair<std::vector<uint8_t>, std::string> cases[] = {
      {{0x00, 0xA4, 0x04, 0x00, 0x00}, "AT+CSIM=10,\"00A4040000\""},
      {{0x80, 0xCA, 0x9F, 0x7F}, "AT+CSIM=8,\"80CA9F7F\""},
      {{0x45, 0xB0, 0x00, 0x00, 0x10}, "AT+CGLA=265,10,\"45B0000010\""},
      {{0xC3, 0xB0, 0x00, 0x00}, "AT+CGLA=263,8,\"C3B00000\""},
      {{0x83, 0xB0, 0x00, 0x00}, "AT+CGLA=259,8,\"83B00000\""},
      {apdu263, "AT+CGLA=275,526,\"" + hexOf(apdu263) + "\""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.second.substr(0, 40));
    ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, c.first));
    EXPECT_EQ(c.second, modem0_->commands().back());
    EXPECT_EQ(0, g_asyncCmd.param);
    EXPECT_EQ(c.first[0] == 0x00 || c.first[0] == 0x80 ? (std::vector<uint8_t>{0x6A, 0x82})
                                                      : (std::vector<uint8_t>{0x90, 0x00}),
              result());
  }
  // The command log shows at most the first five APDU bytes.
  LogCapture cap;
  apdu263[0] = 0x00;
  ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, apdu263));
  EXPECT_TRUE(cap.contains("request_transmit_apdu, cmd: 005A5A5A5A", kTag));
  EXPECT_FALSE(cap.contains("request_transmit_apdu, cmd: 005A5A5A5A5", kTag));

  const size_t sent = modem0_->commands().size();
  for (const std::vector<uint8_t>& refused : std::vector<std::vector<uint8_t>>{
           {0x00, 0xA4, 0x04}, {}, {0x02, 0xB0, 0x00, 0x00}, {0x4E, 0xB0, 0x00, 0x00}}) {
    ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, refused));
    EXPECT_EQ(1, g_asyncCmd.param) << hexOf(refused);
  }
  EXPECT_EQ(sent, modem0_->commands().size());
}

TEST_F(Engine, TransmitAnswers) {
  startWorker(0);
  const std::vector<uint8_t> apdu = {0x00, 0xB0, 0x00, 0x00, 0x02};
  const std::string hex263(526, '9');
  expectRows("AT+CSIM=", REQUEST_TRANSMIT_APDU, apdu,
             {{okLine("+CSIM: 8,\"01029000\""), 0, 4, {0x01, 0x02, 0x90, 0x00}, nullptr},
              {okLine("+CSIM: 80,\"9000\""), 0, 2, {0x90, 0x00}, nullptr},
              {okLine("+CSIM: 5,\"90000\""), 0, -1, {}, nullptr},
              // A length shorter than the text, or a single byte: no status word.
              {okLine("+CSIM: 2,\"9000\""), 1, 5, apdu, "request_transmit_apdu, length 2 shorter than the 4 hex digits"},
              {okLine("+CSIM: 3,\"9000\""), 1, 5, apdu, "request_transmit_apdu, length 3 shorter"},
              {okLine("+CSIM: 2,\"90\""), 1, 5, apdu, "request_transmit_apdu, one-byte answer has no status word"},
              {okLine("+CSIM: 0,\"\""), 0, 0, {}, nullptr},
              {okLine("+CSIM: 526," + hex263), 0, 263, std::vector<uint8_t>(263, 0x99), nullptr},
              {okLine("+CSIM: 528," + hex263 + "99"), 1, 5, apdu, "request_transmit_apdu, response of 528 hex digits"},
              {finalLine("+CME ERROR: 716"), 1, 5, apdu, "request_transmit_apdu:cmd return errno="},
              {okLine("+CSIM: ,\"9000\""), 1, 5, apdu, nullptr},
              {okLine("+CSIM: 4"), 1, 5, apdu, nullptr}});
}

TEST_F(Engine, EachModemHasItsOwnSessionTable) {
  startModem1();
  startWorker(0);
  startWorker(1);
  modem0_->setScript(scriptOf(openReplies(258, okLine("+CGLA: 4,9000"))));
  modem1_->setScript(scriptOf({{"AT+CGLA=", okLine("+CGLA: 4,9000")}}));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, kAid));
  ASSERT_EQ(2, g_asyncCmd.data[0]);
  modem0_->clearCommands();
  const std::vector<uint8_t> apdu = {0x02, 0xB0, 0x00, 0x00};
  ASSERT_EQ(0, push(1, REQUEST_TRANSMIT_APDU, apdu));
  EXPECT_EQ(1, g_asyncCmd.param);
  EXPECT_EQ(1, closeOn(1, 2));
  EXPECT_TRUE(modem1_->commands().empty());
  ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, apdu));
  EXPECT_EQ(0, g_asyncCmd.param);
  EXPECT_EQ((std::vector<std::string>{"AT+CGLA=258,8,\"02B00000\""}), modem0_->commands());
}

}  // namespace

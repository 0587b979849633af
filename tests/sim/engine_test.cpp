// The request engine and the request handlers against a scripted modem on a
// pty: what the worker writes to the port and what lands in g_asyncCmd.
#include <gtest/gtest.h>
#include <host/log_capture.h>
#include <log/log.h>
#include <pty.h>
#include <sys/wait.h>

#include <cstdio>
#include <fstream>
#include <sstream>

#include <atomic>
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

class Engine : public sim_test::EngineTest {};

Replies openReplies(int session, const std::string& select);

TEST_F(Engine, PushRefusalsAndAcceptedEdges) {
  LogCapture cap;
  // Before the worker has its port, modem 0 is refused like any closed port.
  EXPECT_EQ(-1, push(0, REQUEST_GET_CARD_PRESENT, {}));
  EXPECT_TRUE(cap.contains("asyncCmdPush, atPortOpened[0] not open", kTag));
  startWorker(0);

  const std::vector<uint8_t> five(5, 0xAA);
  struct Refusal {
    int32_t modem, request;
    const uint8_t* data;
    int32_t len;
    const char* log;
  };
  const Refusal refusals[] = {
      {2, 1, nullptr, 0, "asyncCmdPush, index: 2 is invalid"},
      {-1, 1, nullptr, 0, "asyncCmdPush, index: -1 is invalid"},
      {1, 1, nullptr, 0, "asyncCmdPush, atPortOpened[1] not open"},
      {0, 0, nullptr, 0, "asyncCmdPush, request: 0 is invalid"},
      {0, 7, nullptr, 0, "asyncCmdPush, request: 7 is invalid"},
      {0, 5, five.data(), 264, "asyncCmdPush, datalen: 264 is invalid"},
      {0, 5, five.data(), -1, "asyncCmdPush, datalen: -1 is invalid"},
      {0, 5, nullptr, 5, "asyncCmdPush, data is NULL"},
  };
  for (const Refusal& r : refusals) {
    SCOPED_TRACE(r.log);
    cap.clear();
    g_asyncCmd.param = 4321;
    g_asyncCmd.datalen = 77;
    EXPECT_EQ(-1, asyncCmdPush(r.modem, r.request, r.data, r.len));
    std::vector<android::host::LogRecord> lines = cap.find(r.log, kTag);
    ASSERT_EQ(1u, lines.size());
    EXPECT_EQ(ANDROID_LOG_ERROR, lines[0].priority);
    EXPECT_EQ(77, g_asyncCmd.datalen);  // nothing written
  }
  EXPECT_TRUE(modem0_->commands().empty());

  // Request 3 has no handler: the push returns 0, param is kept, and the
  // record holds what the push wrote (263 bytes are accepted).
  std::vector<uint8_t> full(263);
  for (size_t i = 0; i < full.size(); i++) full[i] = static_cast<uint8_t>(i);
  cap.clear();
  EXPECT_EQ(0, push(0, 3, full, 1234));
  EXPECT_TRUE(cap.contains("processRequest, request 3 not support", kTag));
  EXPECT_TRUE(cap.contains("cmdloop, deal command=3,0", kTag));
  EXPECT_EQ(1234, g_asyncCmd.param);
  EXPECT_EQ(263, g_asyncCmd.datalen);
  EXPECT_EQ(full, result());
  EXPECT_EQ(CMD_STATE_RESPONSE, g_asyncCmd.state);

  // Length 0 without data is accepted and leaves the data area alone.
  EXPECT_EQ(0, push(0, 3, {}, 99));
  EXPECT_EQ(0, g_asyncCmd.datalen);
  EXPECT_EQ(0, memcmp(full.data(), g_asyncCmd.data, full.size()));
  EXPECT_TRUE(modem0_->commands().empty());
}

TEST_F(Engine, InitAtChannelStartsOneWorkerPerModem) {
  LogCapture cap;
  EXPECT_EQ(-1, init_at_channel(2));
  EXPECT_EQ(-1, init_at_channel(-1));
  EXPECT_TRUE(cap.records().empty());
  EXPECT_EQ(0, asyncCmdInited[0]);
  // Two inits at once (the front's init runs without its lock): the 20 ms
  // start pause at full length leaves room for a second start.
  se_delay::setDivisorForTest(1);
  std::vector<std::thread> inits;
  std::atomic<int> failed{0};
  for (int i = 0; i < 2; i++) {
    inits.emplace_back([&] {
      if (init_at_channel(0) != 0) failed++;
    });
  }
  for (std::thread& t : inits) t.join();
  EXPECT_EQ(0, failed.load());
  ASSERT_TRUE(waitUntil([] { return atPortOpened[0] == 1; }));
  EXPECT_EQ(0, init_at_channel(0));
  EXPECT_EQ(1u, cap.find("asyncCmdInit, devpath: /dev/appvcom18", kTag).size());
  EXPECT_EQ(1u, cap.find("cmdloop[0] > Start...", kTag).size());
  EXPECT_EQ(0, asyncCmdInited[1]);
}

TEST_F(Engine, PortOpensAtThirdAttempt) {
  auto late = sim_test::modemAt(root_.at("dev/appvcom34"), /*linkNow=*/false);
  ASSERT_TRUE(late);
  late->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,1,0")}}));
  // The port appears on the worker's thread right before its third try.
  sim_test::setBeforeOpen([&](const std::string& path, int attempt) {
    if (attempt == 3 && path.find("appvcom34") != std::string::npos) late->link();
  });
  LogCapture cap;
  ASSERT_EQ(0, init_at_channel(1));
  ASSERT_TRUE(waitUntil([] { return atPortOpened[1] == 1; }));

  std::vector<android::host::LogRecord> opens = cap.find("cmdloop[1] open[/dev/appvcom34] fd: ", kTag);
  ASSERT_EQ(3u, opens.size());
  EXPECT_NE(std::string::npos, opens[0].text.find("fd: -1, openTryCount: 5"));
  EXPECT_NE(std::string::npos, opens[1].text.find("fd: -1, openTryCount: 4"));
  EXPECT_NE(std::string::npos, opens[2].text.find(", openTryCount: 3"));
  EXPECT_EQ(std::string::npos, opens[2].text.find("fd: -1"));
  EXPECT_EQ(ANDROID_LOG_INFO, opens[0].priority);

  EXPECT_EQ(0, push(1, REQUEST_GET_CARD_PRESENT, {}));
  EXPECT_EQ(1, g_asyncCmd.param);
  EXPECT_TRUE(late->received("AT^CARDTYPE?"));
}

// A modem whose port comes up only after the six start attempts (a boot
// race) is served once the port is there; until then calls are refused.
TEST_F(Engine, PortThatComesLateIsOpenedOnceThere) {
  se_delay::setDivisorForTest(1000);
  auto late = sim_test::modemAt(root_.at("dev/appvcom34"), /*linkNow=*/false);
  ASSERT_TRUE(late);
  late->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,1,0")}}));
  LogCapture cap;
  ASSERT_EQ(0, init_at_channel(1));
  ASSERT_TRUE(waitUntil([&] { return cap.contains("cmdloop[1] still waiting for the AT port", kTag); }));
  EXPECT_TRUE(cap.contains("cmdloop[1] Wait AT port timeout, fail", kTag));
  EXPECT_EQ(6u, cap.find("cmdloop[1] open[/dev/appvcom34] fd: -1", kTag).size());
  EXPECT_EQ(-1, push(1, REQUEST_GET_CARD_PRESENT, {}));
  EXPECT_EQ(0, init_at_channel(1));  // the same worker keeps trying
  late->link();
  ASSERT_TRUE(waitUntil([] { return atPortOpened[1] == 1; }));
  EXPECT_TRUE(cap.contains("cmdloop[1] open[/dev/appvcom34] fd: ", kTag));
  EXPECT_TRUE(cap.contains(", AT port back", kTag));
  EXPECT_EQ(1u, cap.find("cmdloop[1] > Start...", kTag).size());
  EXPECT_EQ(0, push(1, REQUEST_GET_CARD_PRESENT, {}));
  EXPECT_EQ(1, g_asyncCmd.param);
}

// A lost port (the modem restarts): requests fail while it is away, the
// channels opened before are gone, and the worker serves the port again.
TEST_F(Engine, LostPortIsReopenedAndItsChannelsAreGone) {
  se_delay::setDivisorForTest(1000);
  startWorker(0);
  modem0_->setScript(scriptOf(openReplies(258, okLine("+CGLA: 4,9000"))));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
  ASSERT_EQ(0, g_asyncCmd.param);

  // The port goes away while a SELECT waits for its answer: the open fails
  // without a release command, which could not be sent anyway.
  std::promise<void> selectSent;
  modem0_->setScript([&](FakeModem& m, const std::string& cmd) {
    if (cmd.rfind("AT+CCHP=", 0) == 0) m.send(okLine("+CCHP: 259"));
    if (cmd.rfind("AT+CGLA=", 0) == 0) selectSent.set_value();
  });
  LogCapture cap;
  auto open = std::async(std::launch::async, [&] {
    return push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x01}, 0) == 0 ? g_asyncCmd.param : -100;
  });
  selectSent.get_future().wait();
  modem0_.reset();
  EXPECT_EQ(1, open.get());
  EXPECT_TRUE(cap.contains("transmit_select_cmd:cmd return errno=-3", kTag));
  EXPECT_FALSE(cap.contains("AT+CCHC"));
  EXPECT_FALSE(cap.contains("release of modem session"));
  ASSERT_TRUE(waitUntil([&] { return cap.contains("cmdloop[0] AT port lost", kTag); }));
  EXPECT_EQ(ANDROID_LOG_ERROR, cap.find("cmdloop[0] AT port lost", kTag)[0].priority);
  EXPECT_EQ(-1, push(0, REQUEST_GET_CARD_PRESENT, {}));

  modem0_ = sim_test::modemAt(root_.at("dev/appvcom18"));
  ASSERT_TRUE(modem0_);
  modem0_->setScript(scriptOf({{"AT^CARDTYPE?", okLine("^CARDTYPE: 1,1,0")}}));
  ASSERT_TRUE(waitUntil([] { return atPortOpened[0] == 1; }));
  EXPECT_TRUE(cap.contains("cmdloop[0] open[/dev/appvcom18] fd: ", kTag));
  EXPECT_EQ(0, push(0, REQUEST_GET_CARD_PRESENT, {}));
  EXPECT_EQ(1, g_asyncCmd.param);
  cap.clear();
  ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, {0x02, 0xB0, 0x00, 0x00}));
  EXPECT_EQ(1, g_asyncCmd.param);
  EXPECT_TRUE(cap.contains("request_transmit_apdu, channel 2 is not open", kTag));
}

TEST_F(Engine, CardPresence) {
  startWorker(0);
  struct Case {
    const char* reply;
    int32_t present;
    const char* log;  // error line expected, or nullptr for none
  };
  const Case cases[] = {
      {"^CARDTYPE: 1,1,0", 1, nullptr},
      {"^CARDTYPE: 2,0,1", 1, nullptr},
      {"^CARDTYPE: 1,0,0", 0, nullptr},
      {"^CARDTYPE: 0,1,1", 0, nullptr},
      {"^CARDTYPE: 1,-1,1", 0, nullptr},
      {"^CARDTYPE: 1,2147483647,1", 0, nullptr},  // the 32-bit sum wraps below 0
      {"^CARDTYPE: 1,1", 0, "request_get_card_present: at_tok_nextint has_g failed\n"},
      {"^CARDTYPE: x,1,1", 0, "request_get_card_present: at_tok_nextint cardmode failed\n"},
      {"^CARDTYPE: 1,,1", 0, "request_get_card_present: at_tok_nextint has_c failed\n"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.reply);
    modem0_->setScript(scriptOf({{"AT^CARDTYPE?", okLine(c.reply)}}));
    LogCapture cap;
    ASSERT_EQ(0, push(0, REQUEST_GET_CARD_PRESENT, {}, 55));
    EXPECT_EQ(c.present, g_asyncCmd.param);
    if (c.log) {
      EXPECT_TRUE(cap.contains(c.log, kTag));
    }
  }
  modem0_->setScript(scriptOf({}));
  LogCapture cap;
  ASSERT_EQ(0, push(0, REQUEST_GET_CARD_PRESENT, {}, 55));
  EXPECT_EQ(0, g_asyncCmd.param);
  EXPECT_TRUE(cap.find("request_get_card_present", kTag).size() == 1u);  // only the enter line
  EXPECT_EQ("AT^CARDTYPE?", modem0_->commands().back());
}

TEST_F(Engine, Atr) {
  startWorker(0);
  const std::string atr263(526, 'A');
  struct Case {
    std::string reply;
    int32_t param, datalen;
    std::vector<uint8_t> bytes;
    const char* log;
  };
  const Case cases[] = {
      {okLine("^CARDATR: \"3B00\""), 0, 2, {0x3B, 0x00}, nullptr},
      {okLine("^CARDATR: 3b9f"), 0, 2, {0x3B, 0x9F}, nullptr},
      {okLine("^CARDATR: \"\""), 1, 0, {}, nullptr},
      {okLine("^CARDATR: \"3B0\""), 0, -1, {}, nullptr},
      {okLine("^CARDATR: \"3BG0\""), 0, -1, {}, nullptr},
      {finalLine("ERROR"), 1, 0, {}, "request_get_atr:cmd return errno="},
      // Without the colon the line is not the answer: the exchange fails.
      {okLine("^CARDATR"), 1, 0, {}, "request_get_atr:cmd return errno=-6"},
      {okLine("^CARDATR: \"" + atr263 + "\""), 0, 263, std::vector<uint8_t>(263, 0xAA), nullptr},
      // One byte more than the data area holds is refused, never cut.
      {okLine("^CARDATR: \"" + atr263 + "BB\""), 1, 0, {}, "request_get_atr, atr of 528 hex digits"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.reply.substr(0, 40));
    modem0_->setScript(scriptOf({{"AT^CARDATR", c.reply}}));
    memset(g_asyncCmd.data, 0x55, sizeof(g_asyncCmd.data));
    LogCapture cap;
    ASSERT_EQ(0, push(0, REQUEST_GET_ATR, {}, 7));
    EXPECT_EQ(c.param, g_asyncCmd.param);
    EXPECT_EQ(c.datalen, g_asyncCmd.datalen);
    EXPECT_EQ(c.bytes, result());
    if (c.log) {
      EXPECT_TRUE(cap.contains(c.log, kTag)) << c.log;
    }
  }
  // A malformed pair keeps the bytes before it; the area was zeroed first.
  modem0_->setScript(scriptOf({{"AT^CARDATR", okLine("^CARDATR: 3B9FG0")}}));
  ASSERT_EQ(0, push(0, REQUEST_GET_ATR, {}));
  EXPECT_EQ(-1, g_asyncCmd.datalen);
  EXPECT_EQ(0x3B, g_asyncCmd.data[0]);
  EXPECT_EQ(0x9F, g_asyncCmd.data[1]);
  EXPECT_EQ(0x00, g_asyncCmd.data[2]);
  EXPECT_EQ(0x00, g_asyncCmd.data[262]);
}

// Answers an open with `session` and the SELECT with `select`.
Replies openReplies(int session, const std::string& select) {
  return {{"AT+CCHO=", okLine("+CCHO: " + std::to_string(session))},
          {"AT+CCHP=", okLine("+CCHP: " + std::to_string(session))},
          {"AT+CGLA=", select},
          {"AT+CCHC=", finalLine("OK")}};
}

TEST_F(Engine, OpenLogicalChannelCommandTexts) {
  startWorker(0);
  const std::vector<uint8_t> aid = {0x01, 0x02, 0x03};
  modem0_->setScript(scriptOf(openReplies(258, okLine("+CGLA: 4,\"9000\""))));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, aid, 4));
  EXPECT_EQ((std::vector<std::string>{"AT+CCHP=\"010203\",4",
                                      "AT+CGLA=258,16,\"00A4040403010203\""}),
            modem0_->commands());
  EXPECT_EQ(0, g_asyncCmd.param);
  EXPECT_EQ(2, g_asyncCmd.datalen);
  EXPECT_EQ(0x02, g_asyncCmd.data[0]);
  EXPECT_EQ((std::vector<uint8_t>{0x90, 0x00}), result(1));

  struct Case {
    int32_t p2;
    std::string open, select;
  };
  const Case cases[] = {
      {0x7F, "AT+CCHO=\"010203\"", "AT+CGLA=259,16,\"00A4040003010203\""},
      {0x00, "AT+CCHP=\"010203\",0", "AT+CGLA=259,16,\"00A4040003010203\""},
      {0xFF, "AT+CCHP=\"010203\",255", "AT+CGLA=259,16,\"00A404FF03010203\""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.open);
    modem0_->clearCommands();
    modem0_->setScript(scriptOf(openReplies(259, okLine("+CGLA: 4,9000"))));
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, aid, c.p2));
    EXPECT_EQ((std::vector<std::string>{c.open, c.select}), modem0_->commands());
    EXPECT_EQ(0, g_asyncCmd.param);
    EXPECT_EQ(3, g_asyncCmd.data[0]);
  }

  // AID length limits: 52 bytes fit the 119-character open command.
  std::vector<uint8_t> aid52(52, 0xA0);
  modem0_->clearCommands();
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, aid52, 200));
  ASSERT_EQ(2u, modem0_->commands().size());
  EXPECT_EQ("AT+CCHP=\"" + hexOf(aid52) + "\",200", modem0_->commands()[0]);
  EXPECT_EQ(118u, modem0_->commands()[0].size());
  EXPECT_EQ("AT+CGLA=259,114,\"00A404C834" + hexOf(aid52) + "\"", modem0_->commands()[1]);
  EXPECT_EQ(0, g_asyncCmd.param);

  struct Refused {
    std::vector<uint8_t> aid;
    int32_t p2;
    const char* log;
  };
  const Refused refused[] = {
      {std::vector<uint8_t>(53, 0xA0), 0, "request_open_logical_channel, aid size: 53 too large"},
      {{}, 0, "request_open_logical_channel, aid size: 0 error"},
      {aid, 256, nullptr},
      {aid, -1, nullptr},
  };
  for (const Refused& r : refused) {
    SCOPED_TRACE(r.aid.size());
    modem0_->clearCommands();
    LogCapture cap;
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, r.aid, r.p2));
    EXPECT_EQ(1, g_asyncCmd.param);
    EXPECT_TRUE(modem0_->commands().empty());
    if (r.log) {
      EXPECT_TRUE(cap.contains(r.log, kTag));
    }
  }
}

// Status of a close of `channel` on modem 0 and the commands it sent.
int32_t closeOn(int32_t modem, int32_t channel) {
  g_asyncCmd.param = channel;
  EXPECT_EQ(0, asyncCmdPush(modem, REQUEST_CLOSE_LOGICAL_CHANNEL, nullptr, 0));
  return g_asyncCmd.param;
}

TEST_F(Engine, UnusableSessionIdIsReleasedAtTheModem) {
  startWorker(0);
  // Ids below 1 name no channel: nothing to release.
  for (int session : {20, 32, 0x11F, 0, -32}) {
    SCOPED_TRACE(session);
    modem0_->setScript(scriptOf(openReplies(session, okLine("+CGLA: 4,9000"))));
    modem0_->clearCommands();
    LogCapture cap;
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
    EXPECT_EQ(1, g_asyncCmd.param);
    EXPECT_TRUE(cap.contains("request_open_logical_channel, modem channel " +
                                 std::to_string(session & 0x1F) + " is invalid",
                             kTag));
    std::vector<std::string> sent = {"AT+CCHP=\"A000\",0"};
    if (session >= 1) sent.push_back("AT+CCHC=" + std::to_string(session));
    EXPECT_EQ(sent, modem0_->commands());
  }
}

// 3GPP TS 27.007 lets the modem answer the open with the session id alone.
TEST_F(Engine, OpenTakesTheBareSessionId) {
  startWorker(0);
  for (int32_t p2 : {0x7F, 0x04}) {
    SCOPED_TRACE(p2);
    modem0_->setScript(scriptOf({{"AT+CCH", okLine("258")}, {"AT+CGLA=258,", okLine("+CGLA: 4,9000")}}));
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, p2));
    EXPECT_EQ(0, g_asyncCmd.param);
    EXPECT_EQ(2, g_asyncCmd.data[0]);
    EXPECT_EQ((std::vector<uint8_t>{0x90, 0x00}), result(1));
  }
  // A bare line that is not a number is not the answer.
  modem0_->setScript(scriptOf({{"AT+CCHP=", okLine("25A")}}));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
  EXPECT_EQ(1, g_asyncCmd.param);
}

// A SELECT that timed out leaves no release command behind it: the modem
// did not answer one command and would hold the lock a third time-out.
TEST_F(Engine, TimedOutSelectSendsNoRelease) {
  se_delay::setDivisorForTest(10000);  // 600 s become 60 ms
  startWorker(0);
  modem0_->setScript(scriptOf({{"AT+CCHP=", okLine("+CCHP: 257")}, {"AT+CGLA=", ""}}));
  LogCapture cap;
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
  EXPECT_EQ(1, g_asyncCmd.param);
  EXPECT_TRUE(cap.contains("transmit_select_cmd:cmd return errno=-4", kTag));
  EXPECT_EQ(2u, modem0_->commands().size());
}

TEST_F(Engine, FailedSelectClosesTheModemChannel) {
  startWorker(0);
  struct Case {
    const char* name;
    std::string select;
    const char* log;
  };
  const std::string resp262(524, '1');
  const Case cases[] = {
      {"select refused", finalLine("ERROR"), "transmit_select_cmd:cmd return errno="},
      {"no length", okLine("+CGLA: x"),
       "transmit_select_cmd: at_tok_nextint(&p_line, &response_length) error\n"},
      {"no text", okLine("+CGLA: 4"),
       "transmit_select_cmd: at_tok_nextstr(&p_line, &(response_str)) error\n"},
      {"263 bytes after the channel byte", okLine("+CGLA: 526," + resp262 + "11"),
       "transmit_select_cmd, select response of 526 hex digits"},
      // Without a status word: a length short of the text, or one byte.
      {"length short of the text", okLine("+CGLA: 2,\"9000\""),
       "transmit_select_cmd, length 2 shorter than the 4 hex digits given"},
      {"one byte", okLine("+CGLA: 2,\"90\""), "transmit_select_cmd, one-byte answer has no status word"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    modem0_->setScript(scriptOf(openReplies(0x105, c.select)));
    modem0_->clearCommands();
    LogCapture cap;
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
    EXPECT_EQ(1, g_asyncCmd.param);
    EXPECT_TRUE(cap.contains(c.log, kTag)) << c.log;
    ASSERT_EQ(3u, modem0_->commands().size());
    EXPECT_EQ("AT+CCHC=261", modem0_->commands()[2]);
    // The entry was cleared once the modem closed it.
    modem0_->clearCommands();
    cap.clear();
    EXPECT_EQ(1, closeOn(0, 5));
    EXPECT_TRUE(cap.contains("channel 5's session id 0 is invalid", kTag));
    EXPECT_TRUE(modem0_->commands().empty());
  }
  // 262 bytes after the channel byte still fit.
  modem0_->setScript(scriptOf(openReplies(0x105, okLine("+CGLA: 524," + resp262))));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
  EXPECT_EQ(0, g_asyncCmd.param);
  EXPECT_EQ(262, g_asyncCmd.datalen);
  EXPECT_EQ(std::vector<uint8_t>(262, 0x11), result(1));

  // When the modem refuses the release too, the entry stays for a later close.
  modem0_->setScript(scriptOf({{"AT+CCHP=", okLine("+CCHP: 262")}}));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
  EXPECT_EQ(1, g_asyncCmd.param);
  EXPECT_EQ("AT+CCHC=262", modem0_->commands().back());
  modem0_->setScript(scriptOf({{"AT+CCHC=", finalLine("OK")}}));
  EXPECT_EQ(0, closeOn(0, 6));
  EXPECT_EQ("AT+CCHC=262", modem0_->commands().back());
}

TEST_F(Engine, SelectResponseDecoding) {
  startWorker(0);
  struct Case {
    const char* line;
    int32_t datalen;
    std::vector<uint8_t> bytes;
  };
  const Case cases[] = {
      // The text decoding is shared with transmit; these are the forms
      // its table does not hold.
      {"+CGLA: 4,6f00", 2, {0x6F, 0x00}},
      {"+CGLA: -4,\"9000\"", -1, {}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.line);
    modem0_->setScript(scriptOf(openReplies(0x107, okLine(c.line))));
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
    EXPECT_EQ(0, g_asyncCmd.param);
    EXPECT_EQ(7, g_asyncCmd.data[0]);
    EXPECT_EQ(c.datalen, g_asyncCmd.datalen);
    EXPECT_EQ(c.bytes, result(1));
  }
}

TEST_F(Engine, CloseLogicalChannel) {
  startWorker(0);
  modem0_->setScript(scriptOf(openReplies(0x203, okLine("+CGLA: 4,9000"))));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
  ASSERT_EQ(0, g_asyncCmd.param);

  LogCapture cap;
  for (int32_t channel : {0, 20, -1, 200}) {
    EXPECT_EQ(1, closeOn(0, channel));
    EXPECT_TRUE(cap.contains("channel " + std::to_string(channel) + " is invalid", kTag));
  }
  EXPECT_EQ(1, closeOn(0, 4));
  EXPECT_TRUE(cap.contains("request_close_logical_channel, channel 4's session id 0 is invalid", kTag));

  // A refused close keeps the entry, so it can be tried again.
  modem0_->setScript(scriptOf({{"AT+CCHC=", finalLine("+CME ERROR: 4")}}));
  modem0_->clearCommands();
  EXPECT_EQ(1, closeOn(0, 3));
  EXPECT_TRUE(cap.contains("request_close_logical_channel, fail", kTag));
  modem0_->setScript(scriptOf({{"AT+CCHC=", finalLine("OK")}}));
  EXPECT_EQ(0, closeOn(0, 3));
  EXPECT_EQ((std::vector<std::string>{"AT+CCHC=515", "AT+CCHC=515"}), modem0_->commands());
  cap.clear();
  EXPECT_EQ(1, closeOn(0, 3));
  EXPECT_TRUE(cap.contains("channel 3's session id 0 is invalid", kTag));
  EXPECT_EQ(2u, modem0_->commands().size());
}

TEST_F(Engine, TransmitCommandTextsAndChannels) {
  startWorker(0);
  // Sessions for channels 3, 7, 9 and 19.
  for (int session : {0x103, 0x107, 0x109, 0x113}) {
    modem0_->setScript(scriptOf(openReplies(session, okLine("+CGLA: 4,9000"))));
    ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
    ASSERT_EQ(0, g_asyncCmd.param);
  }
  modem0_->setScript(scriptOf({{"AT+CSIM=", okLine("+CSIM: 4,\"6A82\"")},
                               {"AT+CGLA=", okLine("+CGLA: 4,\"9000\"")}}));
  struct Case {
    std::vector<uint8_t> apdu;
    std::string command;
    int channel;
  };
  const Case cases[] = {
      {{0x00, 0xA4, 0x04, 0x00, 0x00}, "AT+CSIM=10,\"00A4040000\"", 0},
      {{0x80, 0xCA, 0x9F, 0x7F}, "AT+CSIM=8,\"80CA9F7F\"", 0},
      {{0x45, 0xB0, 0x00, 0x00, 0x10}, "AT+CGLA=265,10,\"45B0000010\"", 9},
      {{0x4F, 0xB0, 0x00, 0x00}, "AT+CGLA=275,8,\"4FB00000\"", 19},
      {{0xC3, 0xB0, 0x00, 0x00}, "AT+CGLA=263,8,\"C3B00000\"", 7},
      {{0x83, 0xB0, 0x00, 0x00}, "AT+CGLA=259,8,\"83B00000\"", 3},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.command);
    LogCapture cap;
    ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, c.apdu));
    EXPECT_EQ(c.command, modem0_->commands().back());
    EXPECT_EQ(0, g_asyncCmd.param);
    EXPECT_EQ(c.channel == 0 ? (std::vector<uint8_t>{0x6A, 0x82}) : (std::vector<uint8_t>{0x90, 0x00}),
              result());
    EXPECT_TRUE(cap.contains("logic channel: " + std::to_string(c.channel), kTag));
  }

  // The command log shows at most the first five APDU bytes.
  std::vector<uint8_t> apdu263(263, 0x5A);
  apdu263[0] = 0x00;
  LogCapture cap;
  ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, apdu263));
  EXPECT_EQ("AT+CSIM=526,\"" + hexOf(apdu263) + "\"", modem0_->commands().back());
  EXPECT_TRUE(cap.contains("request_transmit_apdu, cmd: 005A5A5A5A", kTag));
  EXPECT_FALSE(cap.contains("request_transmit_apdu, cmd: 005A5A5A5A5", kTag));
  apdu263[0] = 0x4F;
  ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, apdu263));
  EXPECT_EQ("AT+CGLA=275,526,\"" + hexOf(apdu263) + "\"", modem0_->commands().back());

  size_t sent = modem0_->commands().size();
  struct Refused {
    std::vector<uint8_t> apdu;
    const char* log;
  };
  const Refused refused[] = {
      {{0x00, 0xA4, 0x04}, "request_transmit_apdu, datalen 3 is invalid"},
      {{}, "request_transmit_apdu, datalen 0 is invalid"},
      {{0x02, 0xB0, 0x00, 0x00}, "request_transmit_apdu, channel 2 is not open"},
      {{0x4E, 0xB0, 0x00, 0x00}, "request_transmit_apdu, channel 18 is not open"},
  };
  for (const Refused& r : refused) {
    SCOPED_TRACE(r.log);
    cap.clear();
    ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, r.apdu));
    EXPECT_EQ(1, g_asyncCmd.param);
    EXPECT_TRUE(cap.contains(r.log, kTag));
  }
  EXPECT_EQ(sent, modem0_->commands().size());
}

TEST_F(Engine, TransmitAnswers) {
  startWorker(0);
  const std::vector<uint8_t> apdu = {0x00, 0xB0, 0x00, 0x00, 0x02};
  const std::string hex263(526, '9');
  struct Case {
    std::string reply;
    int32_t param, datalen;
    std::vector<uint8_t> bytes;
    const char* log;
  };
  const Case cases[] = {
      {okLine("+CSIM: 8,\"01029000\""), 0, 4, {0x01, 0x02, 0x90, 0x00}, nullptr},
      {okLine("+CSIM: 80,\"9000\""), 0, 2, {0x90, 0x00}, nullptr},
      {okLine("+CSIM: 5,\"90000\""), 0, -1, {}, nullptr},
      // A length shorter than the text, or a single byte: no status word.
      {okLine("+CSIM: 2,\"9000\""), 1, 5, apdu, "request_transmit_apdu, length 2 shorter than the 4 hex digits"},
      {okLine("+CSIM: 3,\"9000\""), 1, 5, apdu, "request_transmit_apdu, length 3 shorter"},
      {okLine("+CSIM: 2,\"90\""), 1, 5, apdu, "request_transmit_apdu, one-byte answer has no status word"},
      {okLine("+CSIM: 4,\"90ZZ\""), 0, -1, {}, nullptr},
      {okLine("+CSIM: 0,\"\""), 0, 0, {}, nullptr},
      {okLine("+CSIM: 526," + hex263), 0, 263, std::vector<uint8_t>(263, 0x99), nullptr},
      {okLine("+CSIM: 528," + hex263 + "99"), 1, 5, apdu,
       "request_transmit_apdu, response of 528 hex digits"},
      {finalLine("+CME ERROR: 716"), 1, 5, apdu, "request_transmit_apdu:cmd return errno="},
      {okLine("+CSIM"), 1, 5, apdu, "request_transmit_apdu:cmd return errno=-6"},
      {okLine("+CSIM: ,\"9000\""), 1, 5, apdu,
       "request_transmit_apdu: at_tok_nextint(&p_line, &response_length) error\n"},
      {okLine("+CSIM: 4"), 1, 5, apdu,
       "request_transmit_apdu: at_tok_nextstr(&p_line, &(response_str)) error\n"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.reply.substr(0, 40));
    modem0_->setScript(scriptOf({{"AT+CSIM=", c.reply}}));
    LogCapture cap;
    ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, apdu, 42));
    EXPECT_EQ(c.param, g_asyncCmd.param);
    EXPECT_EQ(c.datalen, g_asyncCmd.datalen);
    EXPECT_EQ(c.bytes, result());
    if (c.log) {
      EXPECT_TRUE(cap.contains(c.log, kTag)) << c.log;
    }
  }
}

TEST_F(Engine, EachModemHasItsOwnSessionTable) {
  startModem1();
  startWorker(0);
  startWorker(1);
  modem0_->setScript(scriptOf(openReplies(258, okLine("+CGLA: 4,9000"))));
  modem1_->setScript(scriptOf({{"AT+CGLA=", okLine("+CGLA: 4,9000")}}));
  ASSERT_EQ(0, push(0, REQUEST_OPEN_LOGICAL_CHANNEL, {0xA0, 0x00}, 0));
  ASSERT_EQ(2, g_asyncCmd.data[0]);
  modem0_->clearCommands();

  LogCapture cap;
  const std::vector<uint8_t> apdu = {0x02, 0xB0, 0x00, 0x00};
  ASSERT_EQ(0, push(1, REQUEST_TRANSMIT_APDU, apdu));
  EXPECT_EQ(1, g_asyncCmd.param);
  EXPECT_TRUE(cap.contains("request_transmit_apdu, channel 2 is not open", kTag));
  EXPECT_TRUE(cap.contains("adjust_session, modem_id: 1", kTag));
  EXPECT_TRUE(modem1_->commands().empty());
  EXPECT_EQ(1, closeOn(1, 2));
  EXPECT_TRUE(modem1_->commands().empty());

  ASSERT_EQ(0, push(0, REQUEST_TRANSMIT_APDU, apdu));
  EXPECT_EQ(0, g_asyncCmd.param);
  EXPECT_EQ((std::vector<std::string>{"AT+CGLA=258,8,\"02B00000\""}), modem0_->commands());
}

// The worker must not make the modem port its process's controlling
// terminal: in a fresh session without one, opening the port leaves none.
TEST(EnginePort, DoesNotBecomeControllingTerminal) {
  // No thread may run at the fork, so the pty stays without a modem thread.
  sim_test::TestRoot root;
  int master = -1;
  int slave = -1;
  char name[256] = {0};
  ASSERT_EQ(0, openpty(&master, &slave, name, nullptr, nullptr));
  ASSERT_EQ(0, symlink(name, root.at("dev/appvcom18").c_str()));
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (setsid() < 0) _exit(2);
    if (init_at_channel(0) != 0) _exit(3);
    if (!waitUntil([] { return atPortOpened[0] == 1; })) _exit(4);
    std::ifstream stat("/proc/self/stat");
    std::string content((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
    // Fields after the command name: state ppid pgrp session tty_nr.
    std::istringstream rest(content.substr(content.rfind(')') + 2));
    std::string state;
    long ppid = 0, pgrp = 0, session = 0, ttyNr = -1;
    rest >> state >> ppid >> pgrp >> session >> ttyNr;
    _exit(ttyNr == 0 ? 0 : 5);
  }
  int status = 0;
  ASSERT_EQ(child, waitpid(child, &status, 0));
  close(slave);
  close(master);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(0, WEXITSTATUS(status));
}

}  // namespace

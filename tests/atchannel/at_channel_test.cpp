// The channel over real descriptor pairs, with a scripted modem thread on
// the far end. The test's own thread opens the channel and sends on it.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <host/log_capture.h>
#include <signal.h>

#include <sys/socket.h>

#include <atomic>
#include <future>

#include "atchannel.h"
#include "scripted_modem.h"
#include "se_delay.h"

namespace {

using at_test::eventually;
using at_test::kGenerous;
using at_test::ScriptedModem;
using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

size_t countLogs(const android::host::LogCapture& cap, const std::string& text) {
  return cap.find(text, "atchannel").size();
}

// What the unsolicited handler saw, and an optional action it runs.
struct Unsol {
  std::mutex m;
  std::condition_variable cv;
  std::vector<std::pair<std::string, std::string>> lines;  // pdu "-" when none
  std::function<void(const std::string&)> hook;

  void reset() {
    std::lock_guard<std::mutex> g(m);
    lines.clear();
    hook = nullptr;
  }
  void setHook(std::function<void(const std::string&)> h) {
    std::lock_guard<std::mutex> g(m);
    hook = std::move(h);
  }
  bool waitFor(const std::string& line, milliseconds limit = kGenerous) {
    std::unique_lock<std::mutex> g(m);
    return cv.wait_for(g, limit, [&] {
      for (auto& l : lines) {
        if (l.first == line) return true;
      }
      return false;
    });
  }
  std::vector<std::pair<std::string, std::string>> snapshot() {
    std::lock_guard<std::mutex> g(m);
    return lines;
  }
};
Unsol g_unsol;

void onUnsol(const char* s, const char* pdu) {
  std::function<void(const std::string&)> hook;
  {
    std::lock_guard<std::mutex> g(g_unsol.m);
    g_unsol.lines.emplace_back(s, pdu ? pdu : "-");
    hook = g_unsol.hook;
  }
  g_unsol.cv.notify_all();
  if (hook) hook(s);
}

struct ResponseDeleter {
  void operator()(ATResponse* r) const { at_response_free(r); }
};
using ResponsePtr = std::unique_ptr<ATResponse, ResponseDeleter>;

std::vector<std::string> intermediates(const ATResponse* r) {
  std::vector<std::string> out;
  for (const ATResponseLine* l = r->p_intermediates; l != nullptr; l = l->next) out.push_back(l->text);
  return out;
}

// The process-wide state these tests touch, as at start. The channel's
// own records live per thread; each test closes what it opened.
void resetChannelTests() {
  signal(SIGPIPE, SIG_IGN);
  se_delay::setDivisorForTest(1);
  g_unsol.reset();
  g_ulModemId = 0;
}

// Tests that open their own port, or none.
class ChannelWrite : public ::testing::Test {
 protected:
  void SetUp() override { resetChannelTests(); }
  void TearDown() override {
    at_set_on_timeout(nullptr);
    at_close();
    resetChannelTests();
  }
};
using NoContext = ChannelWrite;

class Channel : public ::testing::Test {
 protected:
  void SetUp() override { resetChannelTests(); }
  void TearDown() override {
    at_close();
    modem_.reset();
    resetChannelTests();
  }
  // Opens the channel on this thread over a socket pair answered by `script`.
  void open(ScriptedModem::Script script, std::unique_ptr<ScriptedModem> modem = ScriptedModem::socketPair()) {
    modem_ = std::move(modem);
    ASSERT_TRUE(modem_);
    fd_ = modem_->portFd();
    modem_->setScript(std::move(script));
    ASSERT_EQ(at_open(fd_, onUnsol, 0), 0);
  }
  std::string tagged(const char* dir, const std::string& rest) {
    return "m0_" + std::to_string(fd_) + dir + rest;
  }

  android::host::LogCapture cap_;
  std::unique_ptr<ScriptedModem> modem_;
  int fd_ = -1;
};

ScriptedModem::Script answer(const std::string& reply) {
  return [reply](ScriptedModem& m, const std::string&) { m.send(reply); };
}

// A reply the test changes between commands; shared with the modem thread,
// which may outlive the test body's locals.
struct SwitchableReply {
  struct State {
    std::mutex m;
    std::string reply;
  };
  std::shared_ptr<State> state = std::make_shared<State>();
  void set(const std::string& r) {
    std::lock_guard<std::mutex> g(state->m);
    state->reply = r;
  }
  ScriptedModem::Script script(const std::string& suffix = "") const {
    std::shared_ptr<State> st = state;
    return [st, suffix](ScriptedModem& fm, const std::string&) {
      std::lock_guard<std::mutex> g(st->m);
      fm.send(st->reply + suffix);
    };
  }
};

TEST_F(Channel, SinglelineExchangeOverSocketAndPty) {
  for (bool usePty : {false, true}) {
    SCOPED_TRACE(usePty ? "pty" : "socket pair");
    open(answer("\r\n^CARDTYPE: 1,1,0\r\n\r\nOK\r\n"),
         usePty ? ScriptedModem::pty() : ScriptedModem::socketPair());
    ATResponse* raw = nullptr;
    ASSERT_EQ(at_send_command_singleline("AT^CARDTYPE?", "^CARDTYPE:", &raw), AT_OK);
    ResponsePtr r(raw);
    ASSERT_TRUE(r);
    EXPECT_EQ(r->success, 1);
    EXPECT_STREQ(r->final_response, "OK");
    ASSERT_EQ(intermediates(r.get()), std::vector<std::string>{"^CARDTYPE: 1,1,0"});
    EXPECT_EQ(modem_->raw(), "AT^CARDTYPE?\r");
    EXPECT_EQ(get_ac_index(), 0);
    EXPECT_TRUE(cap_.contains(tagged(">", "AT^CARDTYPE?\n"), "atchannel"));
    EXPECT_TRUE(cap_.contains(tagged("<", "^CARDTYPE: 1,1,0\n"), "atchannel"));
    at_close();
    EXPECT_TRUE(eventually([&] { return countLogs(cap_, "< reader close.") >= 1; }));
    cap_.clear();
  }
}

TEST_F(Channel, AnswerSplitAcrossReadsAndSeveralLinesInOneRead) {
  open([](ScriptedModem& m, const std::string& cmd) {
    if (cmd.rfind("AT+CCHO=", 0) == 0) {
      // The reader must have handled the first piece before the rest comes.
      m.send("+CREG: 1\r\n+CC");
      g_unsol.waitFor("+CREG: 1");
      m.send("HO: 7");
      m.send("\r\n\r\nO");
      m.send("K\r\n");
    } else {
      m.send("+CSIM: 4,\"9000\"\r\nOK\r\n");
    }
  });
  ATResponse* raw = nullptr;
  ASSERT_EQ(at_send_command_singleline("AT+CCHO=\"A000\"", "+CCHO:", &raw), AT_OK);
  ResponsePtr r(raw);
  EXPECT_EQ(intermediates(r.get()), std::vector<std::string>{"+CCHO: 7"});
  EXPECT_STREQ(r->final_response, "OK");

  ASSERT_EQ(at_send_command_singleline("AT+CSIM=4,\"0070\"", "+CSIM:", &raw), AT_OK);
  ResponsePtr r2(raw);
  EXPECT_EQ(intermediates(r2.get()), std::vector<std::string>{"+CSIM: 4,\"9000\""});
  EXPECT_EQ(r2->success, 1);
}

TEST_F(Channel, ErrorFinalResponses) {
  struct Case {
    const char* reply;
    int32_t rc;
    int32_t cme;
  };
  const Case cases[] = {
      {"+CME ERROR: 4\r\n", AT_OK, 4},
      {"ERROR\r\n", AT_OK, -1},
      {"OK\r\n", AT_ERROR_INVALID_RESPONSE, -1},
  };
  SwitchableReply reply;
  open(reply.script());
  for (const Case& c : cases) {
    reply.set(c.reply);
    ATResponse* raw = reinterpret_cast<ATResponse*>(0x1);  // must be overwritten
    int32_t rc = at_send_command_singleline("AT+CCHO=\"A0\"", "+CCHO:", &raw);
    ResponsePtr r(raw);
    EXPECT_EQ(rc, c.rc) << c.reply;
    if (c.rc == AT_ERROR_INVALID_RESPONSE) {
      EXPECT_EQ(raw, nullptr);
      continue;
    }
    ASSERT_NE(raw, nullptr);
    EXPECT_EQ(r->success, 0);
    EXPECT_EQ(std::string(r->final_response) + "\r\n", c.reply);
    EXPECT_EQ(r->p_intermediates, nullptr);
    EXPECT_EQ(at_get_cme_error(r.get()), c.cme);
  }
}

// Once a command has its final line, a second one is not its answer: it
// goes to the unsolicited handler and the first stays. Repeated, since the
// sender may wake before the reader reaches the second line.
TEST_F(Channel, SecondFinalLineDoesNotReplaceTheFirst) {
  open(answer("+CME ERROR: 5\r\nOK\r\n"));
  for (int i = 0; i < 20; i++) {
    ATResponse* raw = nullptr;
    ASSERT_EQ(at_send_command("AT+X", &raw), AT_OK);
    ResponsePtr r(raw);
    EXPECT_EQ(r->success, 0);
    EXPECT_STREQ(r->final_response, "+CME ERROR: 5");
    ASSERT_TRUE(eventually([&] { return g_unsol.snapshot().size() == static_cast<size_t>(i + 1); }));
    EXPECT_EQ(g_unsol.snapshot().back().first, "OK");
  }
}

// The plain form of 3GPP TS 27.007 (the number alone on its line) is the
// answer only where the command allows it.
TEST_F(Channel, BareNumberAnswersOnlyWhereAllowed) {
  SwitchableReply reply;
  open(reply.script("\r\nOK\r\n"));
  struct Case {
    const char* reply;
    bool numericAllowed;
    int32_t rc;
    const char* intermediate;  // nullptr: none
  };
  const Case cases[] = {
      {"257", true, AT_OK, "257"},
      {"+CCHO: 257", true, AT_OK, "+CCHO: 257"},
      {"257", false, AT_ERROR_INVALID_RESPONSE, nullptr},
      {"25 7", true, AT_ERROR_INVALID_RESPONSE, nullptr},
      {"-1", true, AT_ERROR_INVALID_RESPONSE, nullptr},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.reply) + (c.numericAllowed ? " numeric" : " prefixed"));
    reply.set(c.reply);
    ATResponse* raw = nullptr;
    int32_t rc = c.numericAllowed ? at_send_command_singleline_or_numeric("AT+CCHO=\"A0\"", "+CCHO:", &raw)
                                  : at_send_command_singleline("AT+CCHO=\"A0\"", "+CCHO:", &raw);
    ResponsePtr r(raw);
    EXPECT_EQ(rc, c.rc);
    if (c.intermediate != nullptr) {
      ASSERT_TRUE(r);
      EXPECT_EQ(intermediates(r.get()), std::vector<std::string>{c.intermediate});
    }
  }
}

// How long the pending command has gone without an answer line: what the
// SIM front asks to tell a working modem from a silent one.
TEST_F(Channel, SilenceOfThePendingCommand) {
  open([](ScriptedModem& m, const std::string&) {
    // Answers only once the channel counts the command as silent.
    ASSERT_TRUE(eventually([] { return at_silence_micros(0) >= 2000; }));
    m.send("OK\r\n");
  });
  EXPECT_EQ(at_silence_micros(0), 0);
  EXPECT_EQ(at_send_command("AT+X", nullptr), AT_OK);
  EXPECT_EQ(at_silence_micros(0), 0);
  EXPECT_EQ(at_silence_micros(1), 0);
  EXPECT_EQ(at_silence_micros(2), 0);
}

// A modem that stops reading cannot hold the sender past the command's
// deadline: the write gives up with a time-out and a log line.
TEST_F(ChannelWrite, WriteToAModemThatNeverReadsEndsAtTheDeadline) {
  android::host::LogCapture cap;
  se_delay::setDivisorForTest(1000);  // 600 s become 600 ms
  int sv[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv), 0);
  ASSERT_EQ(at_open(sv[0], onUnsol, 0), 0);  // nobody reads sv[1]
  const std::string huge = "AT+" + std::string(4 << 20, 'A');
  EXPECT_EQ(at_send_command(huge.c_str(), nullptr), AT_ERROR_TIMEOUT);
  EXPECT_EQ(countLogs(cap, "m0_" + std::to_string(sv[0]) + ">write timed out"), 1u);
  // The channel still works for a modem that reads again.
  at_close();
  close(sv[1]);
  se_delay::setDivisorForTest(1);
}

TEST_F(Channel, SilentModemTimesOutAndTheLateAnswerIsUnsolicited) {
  se_delay::setDivisorForTest(1000);  // 600 s become 600 ms
  open(nullptr);
  ATResponse* raw = nullptr;
  auto t0 = Clock::now();
  EXPECT_EQ(at_send_command_singleline("AT^CARDATR", "^CARDATR:", &raw), AT_ERROR_TIMEOUT);
  EXPECT_GE(Clock::now() - t0, milliseconds(590));
  EXPECT_EQ(raw, nullptr);
  modem_->send("^CARDATR: \"3B00\"\r\nOK\r\n");
  ASSERT_TRUE(g_unsol.waitFor("OK"));
  EXPECT_EQ(g_unsol.snapshot()[0].first, "^CARDATR: \"3B00\"");
}

std::atomic<int> g_timeouts{0};
void countTimeout() { ++g_timeouts; }

TEST_F(Channel, TimeoutProbe) {
  se_delay::setDivisorForTest(1000);
  struct Case {
    bool answerProbe;
    int callbacks;
  };
  for (const Case& c : {Case{true, 0}, Case{false, 1}}) {
    SCOPED_TRACE(c.answerProbe ? "probe answered" : "probe silent");
    g_timeouts = 0;
    g_ulModemId = 1;
    cap_.clear();
    open([c](ScriptedModem& m, const std::string& cmd) {
      if (cmd == "AT" && c.answerProbe) m.send("OK\r\n");
    });
    at_set_on_timeout(countTimeout);
    EXPECT_EQ(at_send_command("AT+SLOW", nullptr), AT_ERROR_TIMEOUT);
    EXPECT_EQ(modem_->commands(), (std::vector<std::string>{"AT+SLOW", "AT"}));
    EXPECT_EQ(g_timeouts.load(), c.callbacks);
    EXPECT_EQ(countLogs(cap_, "m1_0< timeout."), static_cast<size_t>(c.callbacks));
    at_set_on_timeout(nullptr);
    at_close();
    modem_.reset();
  }
}

TEST_F(Channel, CloseDuringAWaitEndsItWithChannelClosed) {
  g_unsol.setHook([](const std::string& line) {
    if (line == "+BYE") at_close();  // runs on the reader thread
  });
  open(answer("+BYE\r\n"));
  ATResponse* raw = nullptr;
  EXPECT_EQ(at_send_command_singleline("AT^CARDTYPE?", "^CARDTYPE:", &raw), AT_ERROR_CHANNEL_CLOSED);
  ResponsePtr r(raw);
  ASSERT_TRUE(r);  // the record is handed over even on a close
  EXPECT_EQ(r->success, 0);
  EXPECT_EQ(r->final_response, nullptr);
  EXPECT_TRUE(modem_->waitHangup());
  EXPECT_TRUE(eventually([&] { return countLogs(cap_, "< reader close.") == 1; }));
  EXPECT_TRUE(cap_.contains("Read FD is invalid", "atchannel"));

  // Later commands fail at once without writing.
  EXPECT_EQ(at_send_command("AT", nullptr), AT_ERROR_CHANNEL_CLOSED);
  EXPECT_EQ(modem_->commands().size(), 1u);
  EXPECT_EQ(countLogs(cap_, "writeline error,errno:-3"), 1u);
}

TEST_F(Channel, ModemHangupDuringAWaitEndsItWithChannelClosed) {
  se_delay::setDivisorForTest(100);
  open([](ScriptedModem& m, const std::string&) { m.shutdownWrite(); });
  EXPECT_EQ(at_send_command("AT+X", nullptr), AT_ERROR_CHANNEL_CLOSED);
  EXPECT_TRUE(cap_.contains("atchannel: port stays at end of file", "atchannel"));
  EXPECT_TRUE(eventually([&] { return countLogs(cap_, "< reader close.") == 1; }));
}

TEST_F(Channel, CloseWakesABlockedReaderAtOnceAndItNeverReadsTheReusedNumber) {
  open(nullptr);
  at_close();
  // The old port number is free now; take it again at once.
  int sv[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv), 0);
  ASSERT_EQ(write(sv[1], "DATA\r\n", 6), 6);
  auto t0 = Clock::now();
  ASSERT_TRUE(eventually([&] { return countLogs(cap_, "< reader close.") == 1; }));
  EXPECT_LT(Clock::now() - t0, milliseconds(2000));
  EXPECT_TRUE(cap_.contains("[m0][ch:-1] < reader close.", "atchannel"));
  char buf[16] = {};
  EXPECT_EQ(recv(sv[0], buf, sizeof(buf), MSG_DONTWAIT), 6);
  EXPECT_FALSE(cap_.contains("DATA"));
  close(sv[0]);
  close(sv[1]);
}

TEST_F(Channel, ReaderThreadMayNotSend) {
  static std::atomic<int32_t> fromReader{0};
  static std::atomic<int32_t> fromReaderSingle{0};
  g_unsol.setHook([](const std::string&) {
    fromReader = at_send_command("AT", nullptr);
    ATResponse* r = nullptr;
    fromReaderSingle = at_send_command_singleline("AT", "+X:", &r);
    at_response_free(r);
  });
  open(nullptr);
  modem_->send("+RING\r\n");
  ASSERT_TRUE(g_unsol.waitFor("+RING"));
  EXPECT_TRUE(eventually([&] { return fromReaderSingle.load() != 0; }));
  EXPECT_EQ(fromReader.load(), AT_ERROR_INVALID_THREAD);
  EXPECT_EQ(fromReaderSingle.load(), AT_ERROR_INVALID_THREAD);
  EXPECT_TRUE(modem_->commands().empty());
}

TEST_F(Channel, FloodOfUnsolicitedLinesWhileACommandWaits) {
  constexpr int kLines = 3000;
  open([](ScriptedModem& m, const std::string&) {
    std::string flood;
    for (int i = 0; i < kLines; ++i) flood += "+CREG: " + std::to_string(i) + "\r\n";
    flood += std::string(50000, 'Z');  // no line end: discarded in buffer-sized bites
    flood += "\r\n+CGLA: 2,\"90\"\r\n+CGLA: 9,\"XX\"\r\nOK\r\n";
    m.send(flood);
  });
  ATResponse* raw = nullptr;
  ASSERT_EQ(at_send_command_singleline("AT+CGLA=1,4,\"0000\"", "+CGLA:", &raw), AT_OK);
  ResponsePtr r(raw);
  EXPECT_EQ(intermediates(r.get()), std::vector<std::string>{"+CGLA: 2,\"90\""});
  auto seen = g_unsol.snapshot();
  ASSERT_GE(seen.size(), static_cast<size_t>(kLines));
  EXPECT_EQ(seen[kLines - 1].first, "+CREG: " + std::to_string(kLines - 1));
  EXPECT_EQ(seen.back().first, "+CGLA: 9,\"XX\"");
}

TEST_F(Channel, SmsPairsDoNotEndThePendingCommandAndTheirPduIsNotLogged) {
  open(answer("+CMT: 1\r\nOK\r\n+CDS: 2\r\n0891AB\r\n+CCHO: 7\r\nOK\r\n"));
  ATResponse* raw = nullptr;
  ASSERT_EQ(at_send_command_singleline("AT+CCHO=\"A0000000031010\"", "+CCHO:", &raw), AT_OK);
  ResponsePtr r(raw);
  EXPECT_EQ(intermediates(r.get()), std::vector<std::string>{"+CCHO: 7"});
  auto seen = g_unsol.snapshot();
  ASSERT_EQ(seen.size(), 2u);
  EXPECT_EQ(seen[0], std::make_pair(std::string("+CMT: 1"), std::string("OK")));
  EXPECT_EQ(seen[1], std::make_pair(std::string("+CDS: 2"), std::string("0891AB")));
  EXPECT_EQ(cap_.find(tagged("<", ": ***\n"), "atchannel").size(), 2u);
  EXPECT_FALSE(cap_.contains("0891AB"));
}

TEST_F(Channel, MaskedAndClearLogLines) {
  struct Case {
    const char* command;
    const char* reply;
    const char* sentLog;  // after "m0_<fd>>"
    const char* recvLog;  // after "m0_<fd><"
    const char* secret;   // must appear in no record; null when logged in clear
  };
  const Case cases[] = {
      {"AT+CGLA=1,10,\"00A4040005\"", "+CGLA: 4,\"6F9000\"", "AT+CGLA=***\n", "CGLA: ***\n", "6F9000"},
      {"AT+CCHO=\"A0000000031010\"", "+CCHO: 7", "AT+CCHO==***\n", "+CCHO: 7\n", "A0000000031010"},
      {"AT+CSIM=10,\"00B0000011\"", "+CSIM: 4,\"6A82\"", "AT+CSIM==***\n", "CSIM:: ***\n", "00B0000011"},
      {"AT^CARDATR", "^CARDATR: \"3B9F\"", "AT^CARDATR\n", "^CARDATR: \"3B9F\"\n", nullptr},
  };
  SwitchableReply reply;
  open(reply.script("\r\nOK\r\n"));
  for (const Case& c : cases) {
    reply.set(c.reply);
    ASSERT_EQ(at_send_command(c.command, nullptr), AT_OK) << c.command;
    EXPECT_TRUE(cap_.contains(tagged(">", c.sentLog), "atchannel")) << c.command;
    EXPECT_TRUE(cap_.contains(tagged("<", c.recvLog), "atchannel")) << c.reply;
    if (c.secret != nullptr) {
      EXPECT_FALSE(cap_.contains(c.secret)) << c.secret;
    }
  }
}

TEST_F(Channel, SecondOpenOnAThreadReusesItsContext) {
  open(answer("OK\r\n"));
  // This thread may already hold a record from an earlier test in the same
  // process; either way, no further record may be made from here on.
  const size_t made = countLogs(cap_, "ac is null, will malloc");
  ScriptedModem* first = modem_.release();
  auto second = ScriptedModem::socketPair();
  ASSERT_TRUE(second);
  second->setScript(answer("OK\r\n"));
  ASSERT_EQ(at_open(second->portFd(), onUnsol, 1), 0);
  EXPECT_TRUE(cap_.contains("ac is not null", "atchannel"));
  EXPECT_EQ(countLogs(cap_, "ac is null, will malloc"), made);
  EXPECT_EQ(get_ac_index(), 1);
  EXPECT_TRUE(first->waitHangup());  // the earlier port was let go
  EXPECT_EQ(at_send_command("AT+ONE", nullptr), AT_OK);
  EXPECT_EQ(second->commands(), std::vector<std::string>{"AT+ONE"});
  EXPECT_TRUE(first->commands().empty());
  delete first;

  // Closed and opened again: the same record serves, commands still work.
  at_close();
  modem_ = std::move(second);
  auto third = ScriptedModem::socketPair();
  third->setScript(answer("OK\r\n"));
  ASSERT_EQ(at_open(third->portFd(), onUnsol, 0), 0);
  EXPECT_EQ(at_send_command("AT+TWO", nullptr), AT_OK);
  EXPECT_EQ(third->commands(), std::vector<std::string>{"AT+TWO"});
  at_close();
  EXPECT_EQ(countLogs(cap_, "ac is null, will malloc"), made);
}

TEST_F(Channel, OpenWithoutAPortEndsTheReaderAndCommandsFail) {
  ASSERT_EQ(at_open(-1, onUnsol, 1), 0);
  EXPECT_TRUE(eventually([&] { return countLogs(cap_, "< reader close.") == 1; }));
  EXPECT_TRUE(cap_.contains("Read FD is invalid", "atchannel"));
  EXPECT_TRUE(cap_.contains("atchannel: read error", "atchannel"));
  EXPECT_EQ(at_send_command("AT", nullptr), AT_ERROR_CHANNEL_CLOSED);
  EXPECT_EQ(at_open(-1, onUnsol, 2), -1);  // only two modem slots
}

TEST_F(ChannelWrite, FailingWritesGiveUpAfterFiveAttempts) {
  android::host::LogCapture cap;
  se_delay::setDivisorForTest(1000);
  int p[2];
  ASSERT_EQ(pipe2(p, O_CLOEXEC), 0);
  // A pipe's read end reads fine but refuses every write.
  ASSERT_EQ(at_open(p[0], onUnsol, 0), 0);
  const std::string sent = "m0_" + std::to_string(p[0]) + ">AT+TEST\n";
  EXPECT_EQ(at_send_command("AT+TEST", nullptr), AT_ERROR_WRITE_FAILED);
  EXPECT_EQ(countLogs(cap, sent), 5u);
  EXPECT_EQ(countLogs(cap, "writeline error,errno:-1"), 5u);

  // With a time-out callback the probe "AT" is tried five times too.
  g_timeouts = 0;
  at_set_on_timeout(countTimeout);
  EXPECT_EQ(at_send_command("AT+TEST", nullptr), AT_ERROR_WRITE_FAILED);
  EXPECT_EQ(countLogs(cap, "m0_" + std::to_string(p[0]) + ">AT\n"), 5u);
  EXPECT_EQ(g_timeouts.load(), 1);
  EXPECT_EQ(countLogs(cap, "m0_0< timeout."), 1u);
  at_set_on_timeout(nullptr);  // the thread's context outlives the test
  at_close();
  close(p[1]);
  se_delay::setDivisorForTest(1);
}

TEST_F(NoContext, OperationsOnAThreadWithoutAPortFail) {
  android::host::LogCapture cap;
  int32_t send = 0, single = 0, index = 0;
  ATResponse* r = reinterpret_cast<ATResponse*>(0x1);
  std::thread([&] {
    send = at_send_command("AT", nullptr);
    single = at_send_command_singleline("AT", "+X:", &r);
    at_set_on_timeout(countTimeout);
    index = get_ac_index();
    at_close();
  }).join();
  EXPECT_EQ(send, AT_ERROR_GENERIC);
  EXPECT_EQ(single, AT_ERROR_GENERIC);
  EXPECT_EQ(r, nullptr);
  EXPECT_EQ(index, -1);
  EXPECT_EQ(countLogs(cap, "getAtContext, m0 ac is NULL"), 5u);
  EXPECT_EQ(countLogs(cap, "getAtContext return null pointer!"), 4u);
  EXPECT_EQ(countLogs(cap, "get_ac_index:getAtContext return null pointer!"), 1u);
}

}  // namespace

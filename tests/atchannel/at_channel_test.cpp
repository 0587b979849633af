// The channel over real descriptor pairs, with a scripted modem thread on
// the far end. The test's own thread opens the channel and sends on it.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <host/log_capture.h>
#include <signal.h>
#include <sys/socket.h>

#include <atomic>

#include "atchannel.h"
#include "scripted_modem.h"
#include "se_delay.h"

namespace {

using at_test::eventually;
using at_test::kGenerous;
using at_test::ScriptedModem;
using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;
using Lines = std::vector<std::string>;

// What the unsolicited handler saw (pdu "-" when none), and a hook it runs.
struct Unsol {
  std::mutex m;
  std::condition_variable cv;
  std::vector<std::pair<std::string, std::string>> lines;
  std::function<void(const std::string&)> hook;

  bool waitFor(const std::string& line) {
    std::unique_lock<std::mutex> g(m);
    return cv.wait_for(g, kGenerous, [&] { return !lines.empty() && lines.back().first == line; });
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

Lines intermediates(const ATResponse* r) {
  Lines out;
  for (const ATResponseLine* l = r->p_intermediates; l != nullptr; l = l->next) out.push_back(l->text);
  return out;
}

std::atomic<int> g_timeouts{0};
void countTimeout() { ++g_timeouts; }

ScriptedModem::Script answer(const std::string& reply) {
  return [reply](ScriptedModem& m, const std::string&) { m.send(reply); };
}

// The channel's records live per thread; each test closes what it opened
// and puts the process-wide state back as at start.
class Channel : public ::testing::Test {
 protected:
  void SetUp() override { reset(); }
  void TearDown() override {
    at_set_on_timeout(nullptr);
    at_close();
    modem_.reset();
    reset();
  }
  static void reset() {
    signal(SIGPIPE, SIG_IGN);
    se_delay::setDivisorForTest(1);
    std::lock_guard<std::mutex> g(g_unsol.m);
    g_unsol.lines.clear();
    g_unsol.hook = nullptr;
    g_ulModemId = 0;
    g_timeouts = 0;
  }
  // Opens the channel on this thread over a socket pair answered by `script`.
  void open(ScriptedModem::Script script, std::unique_ptr<ScriptedModem> modem = ScriptedModem::socketPair()) {
    modem_ = std::move(modem);
    ASSERT_TRUE(modem_);
    fd_ = modem_->portFd();
    modem_->setScript(std::move(script));
    ASSERT_EQ(at_open(fd_, onUnsol, 0), 0);
  }
  // Answers each command with the reply set last, then `suffix`.
  void openSwitchable(const std::string& suffix = "") {
    auto reply = reply_;
    open([reply, suffix](ScriptedModem& m, const std::string&) {
      std::lock_guard<std::mutex> g(reply->first);
      m.send(reply->second + suffix);
    });
  }
  void setReply(const std::string& r) {
    std::lock_guard<std::mutex> g(reply_->first);
    reply_->second = r;
  }
  size_t logs(const std::string& text) { return cap_.find(text, "atchannel").size(); }
  std::string tagged(const char* dir, const std::string& rest) { return "m0_" + std::to_string(fd_) + dir + rest; }

  android::host::LogCapture cap_;
  std::unique_ptr<ScriptedModem> modem_;
  std::shared_ptr<std::pair<std::mutex, std::string>> reply_ = std::make_shared<std::pair<std::mutex, std::string>>();
  int fd_ = -1;
};

TEST_F(Channel, SinglelineExchangeOverSocketAndPty) {
  for (bool usePty : {false, true}) {
    SCOPED_TRACE(usePty ? "pty" : "socket pair");
    open(answer("\r\n^CARDTYPE: 1,1,0\r\n\r\nOK\r\n"), usePty ? ScriptedModem::pty() : ScriptedModem::socketPair());
    ATResponse* raw = nullptr;
    ASSERT_EQ(at_send_command_singleline("AT^CARDTYPE?", "^CARDTYPE:", &raw), AT_OK);
    ResponsePtr r(raw);
    EXPECT_EQ(r->success, 1);
    EXPECT_STREQ(r->final_response, "OK");
    EXPECT_EQ(intermediates(r.get()), Lines{"^CARDTYPE: 1,1,0"});
    EXPECT_EQ(modem_->commands(), Lines{"AT^CARDTYPE?"});
    at_close();
  }
}

// Once a command has its final line, a second one is not its answer: it
// goes to the unsolicited handler and the first stays. Repeated, since the
// sender may wake before the reader reaches the second line.
TEST_F(Channel, SecondFinalLineDoesNotReplaceTheFirst) {
  open(answer("+CME ERROR: 5\r\nOK\r\n"));
  for (size_t i = 1; i <= 20; i++) {
    ATResponse* raw = nullptr;
    ASSERT_EQ(at_send_command("AT+X", &raw), AT_OK);
    ResponsePtr r(raw);
    EXPECT_STREQ(r->final_response, "+CME ERROR: 5");
    ASSERT_TRUE(eventually([&] { return g_unsol.snapshot().size() == i; }));
    EXPECT_EQ(g_unsol.snapshot().back().first, "OK");
  }
}

// Final lines and the number-alone answer, which counts only where the
// command allows it.
TEST_F(Channel, AnswerForms) {
  openSwitchable();
  struct Case {
    const char* reply;
    bool numericAllowed;
    int32_t rc;
    const char* final;         // nullptr: no record handed back
    const char* intermediate;  // nullptr: none
    int32_t cme;
  };
  const Case cases[] = {
      {"257\r\nOK", true, AT_OK, "OK", "257", 0},
      {"+CCHO: 257\r\nOK", true, AT_OK, "OK", "+CCHO: 257", 0},
      {"257\r\nOK", false, AT_ERROR_INVALID_RESPONSE, nullptr, nullptr, 0},
      {"25 7\r\nOK", true, AT_ERROR_INVALID_RESPONSE, nullptr, nullptr, 0},
      {"-1\r\nOK", true, AT_ERROR_INVALID_RESPONSE, nullptr, nullptr, 0},
      {"+CME ERROR: 4", false, AT_OK, "+CME ERROR: 4", nullptr, 4},
      {"ERROR", false, AT_OK, "ERROR", nullptr, -1},
      {"OK", false, AT_ERROR_INVALID_RESPONSE, nullptr, nullptr, 0},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.reply) + (c.numericAllowed ? " numeric" : " prefixed"));
    setReply(std::string(c.reply) + "\r\n");
    ATResponse* raw = reinterpret_cast<ATResponse*>(0x1);  // must be overwritten
    ASSERT_EQ(c.rc, c.numericAllowed ? at_send_command_singleline_or_numeric("AT+CCHO=\"A0\"", "+CCHO:", &raw)
                                     : at_send_command_singleline("AT+CCHO=\"A0\"", "+CCHO:", &raw));
    ResponsePtr r(raw);
    if (!c.final) {
      EXPECT_EQ(raw, nullptr);
      continue;
    }
    EXPECT_STREQ(c.final, r->final_response);
    EXPECT_EQ(c.intermediate ? Lines{c.intermediate} : Lines{}, intermediates(r.get()));
    EXPECT_EQ(c.cme, at_get_cme_error(r.get()));
  }
}

// A modem that stops reading cannot hold the sender past the command's
// deadline: the write gives up with a time-out and a log line.
TEST_F(Channel, WriteToAModemThatNeverReadsEndsAtTheDeadline) {
  se_delay::setDivisorForTest(1000);  // 600 s become 600 ms
  int sv[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv), 0);
  ASSERT_EQ(at_open(sv[0], onUnsol, 0), 0);  // nobody reads sv[1]
  const std::string huge = "AT+" + std::string(4 << 20, 'A');
  EXPECT_EQ(at_send_command(huge.c_str(), nullptr), AT_ERROR_TIMEOUT);
  EXPECT_EQ(logs("m0_" + std::to_string(sv[0]) + ">write timed out"), 1u);
  at_close();
  close(sv[1]);
}

TEST_F(Channel, SilentModemTimesOutAndTheLateAnswerIsUnsolicited) {
  se_delay::setDivisorForTest(1000);
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

// After a time-out an "AT" probe is sent; the callback runs only when the
// probe goes unanswered too.
TEST_F(Channel, TimeoutProbe) {
  se_delay::setDivisorForTest(1000);
  for (bool answerProbe : {true, false}) {
    SCOPED_TRACE(answerProbe);
    g_timeouts = 0;
    open([answerProbe](ScriptedModem& m, const std::string& cmd) {
      if (cmd == "AT" && answerProbe) m.send("OK\r\n");
    });
    at_set_on_timeout(countTimeout);
    EXPECT_EQ(at_send_command("AT+SLOW", nullptr), AT_ERROR_TIMEOUT);
    EXPECT_EQ(modem_->commands(), (Lines{"AT+SLOW", "AT"}));
    EXPECT_EQ(g_timeouts.load(), answerProbe ? 0 : 1);
    at_close();
  }
}

TEST_F(Channel, CloseDuringAWaitEndsItWithChannelClosed) {
  g_unsol.hook = [](const std::string& line) {
    if (line == "+BYE") at_close();  // runs on the reader thread
  };
  open(answer("+BYE\r\n"));
  ATResponse* raw = nullptr;
  EXPECT_EQ(at_send_command_singleline("AT^CARDTYPE?", "^CARDTYPE:", &raw), AT_ERROR_CHANNEL_CLOSED);
  ResponsePtr r(raw);
  ASSERT_TRUE(r);  // the record is handed over even on a close
  EXPECT_EQ(r->final_response, nullptr);
  EXPECT_TRUE(modem_->waitHangup());
  // Later commands fail at once without writing.
  EXPECT_EQ(at_send_command("AT", nullptr), AT_ERROR_CHANNEL_CLOSED);
  EXPECT_EQ(modem_->commands().size(), 1u);
}

TEST_F(Channel, ModemHangupDuringAWaitEndsItWithChannelClosed) {
  se_delay::setDivisorForTest(100);
  open([](ScriptedModem& m, const std::string&) { m.shutdownWrite(); });
  EXPECT_EQ(at_send_command("AT+X", nullptr), AT_ERROR_CHANNEL_CLOSED);
  EXPECT_TRUE(eventually([&] { return logs("< reader close.") == 1; }));
}

TEST_F(Channel, CloseWakesABlockedReaderAtOnceAndItNeverReadsTheReusedNumber) {
  open(nullptr);
  at_close();
  // The old port number is free now; take it again at once.
  int sv[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv), 0);
  ASSERT_EQ(write(sv[1], "DATA\r\n", 6), 6);
  ASSERT_TRUE(eventually([&] { return logs("< reader close.") == 1; }, milliseconds(2000)));
  char buf[16] = {};
  EXPECT_EQ(recv(sv[0], buf, sizeof(buf), MSG_DONTWAIT), 6);
  close(sv[0]);
  close(sv[1]);
}

TEST_F(Channel, ReaderThreadMayNotSend) {
  static std::atomic<int32_t> fromReader{0};
  g_unsol.hook = [](const std::string&) { fromReader = at_send_command("AT", nullptr); };
  open(nullptr);
  modem_->send("+RING\r\n");
  ASSERT_TRUE(eventually([&] { return fromReader.load() != 0; }));
  EXPECT_EQ(fromReader.load(), AT_ERROR_INVALID_THREAD);
  EXPECT_TRUE(modem_->commands().empty());
}

TEST_F(Channel, SmsPairsDoNotEndThePendingCommandAndTheirPduIsNotLogged) {
  open(answer("+CMT: 1\r\nOK\r\n+CDS: 2\r\n0891AB\r\n+CCHO: 7\r\nOK\r\n"));
  ATResponse* raw = nullptr;
  ASSERT_EQ(at_send_command_singleline("AT+CCHO=\"A0000000031010\"", "+CCHO:", &raw), AT_OK);
  ResponsePtr r(raw);
  EXPECT_EQ(intermediates(r.get()), Lines{"+CCHO: 7"});
  auto seen = g_unsol.snapshot();
  ASSERT_EQ(seen.size(), 2u);
  EXPECT_EQ(seen[0], std::make_pair(std::string("+CMT: 1"), std::string("OK")));
  EXPECT_EQ(seen[1], std::make_pair(std::string("+CDS: 2"), std::string("0891AB")));
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
      {"AT^CARDATR", "^CARDATR: \"3B9F\"", "AT^CARDATR\n", "^CARDATR: \"3B9F\"\n", nullptr},
  };
  openSwitchable("\r\nOK\r\n");
  for (const Case& c : cases) {
    SCOPED_TRACE(c.command);
    setReply(c.reply);
    ASSERT_EQ(at_send_command(c.command, nullptr), AT_OK);
    EXPECT_TRUE(cap_.contains(tagged(">", c.sentLog), "atchannel"));
    EXPECT_TRUE(cap_.contains(tagged("<", c.recvLog), "atchannel"));
    if (c.secret != nullptr) {
      EXPECT_FALSE(cap_.contains(c.secret));
    }
  }
}

TEST_F(Channel, SecondOpenOnAThreadReusesItsContext) {
  open(answer("OK\r\n"));
  // This thread may hold a record from an earlier test; no further one may
  // be made from here on.
  const size_t made = logs("ac is null, will malloc");
  auto second = ScriptedModem::socketPair();
  ASSERT_TRUE(second);
  second->setScript(answer("OK\r\n"));
  ASSERT_EQ(at_open(second->portFd(), onUnsol, 1), 0);
  EXPECT_EQ(get_ac_index(), 1);
  EXPECT_TRUE(modem_->waitHangup());  // the earlier port was let go
  EXPECT_EQ(at_send_command("AT+ONE", nullptr), AT_OK);
  EXPECT_EQ(second->commands(), Lines{"AT+ONE"});
  EXPECT_TRUE(modem_->commands().empty());
  EXPECT_EQ(logs("ac is null, will malloc"), made);
  at_close();
}

TEST_F(Channel, OpenWithoutAPortEndsTheReaderAndCommandsFail) {
  ASSERT_EQ(at_open(-1, onUnsol, 1), 0);
  EXPECT_TRUE(eventually([&] { return logs("< reader close.") == 1; }));
  EXPECT_EQ(at_send_command("AT", nullptr), AT_ERROR_CHANNEL_CLOSED);
  EXPECT_EQ(at_open(-1, onUnsol, 2), -1);  // only two modem slots
}

TEST_F(Channel, FailingWritesGiveUpAfterFiveAttempts) {
  se_delay::setDivisorForTest(1000);
  int p[2];
  ASSERT_EQ(pipe2(p, O_CLOEXEC), 0);
  // A pipe's read end reads fine but refuses every write.
  ASSERT_EQ(at_open(p[0], onUnsol, 0), 0);
  EXPECT_EQ(at_send_command("AT+TEST", nullptr), AT_ERROR_WRITE_FAILED);
  EXPECT_EQ(logs("m0_" + std::to_string(p[0]) + ">AT+TEST\n"), 5u);
  // With a time-out callback the probe "AT" is tried five times too.
  at_set_on_timeout(countTimeout);
  EXPECT_EQ(at_send_command("AT+TEST", nullptr), AT_ERROR_WRITE_FAILED);
  EXPECT_EQ(logs("m0_" + std::to_string(p[0]) + ">AT\n"), 5u);
  EXPECT_EQ(g_timeouts.load(), 1);
  at_close();
  close(p[1]);
}

TEST_F(Channel, OperationsOnAThreadWithoutAPortFail) {
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
}

}  // namespace

// modem-sim as a real process over its pty.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "se_harness.h"

namespace {

using Lines = std::vector<std::string>;
constexpr int kTimeoutMs = 5000;

bool isFinal(const std::string& l) { return l == "OK" || l == "ERROR" || l.rfind("+CME ERROR:", 0) == 0; }

// modem-sim in a fresh device root, logging to a file; the test speaks to
// its port as the daemon would.
class Sim {
 public:
  explicit Sim(std::vector<std::string> args, int modem = 0)
      : logPath_(root_.at("sim.log")),
        port_(root_.at(modem == 0 ? "dev/appvcom18" : "dev/appvcom34")),
        proc_(withProgram(args, root_.path(), logPath_), root_.path()) {}
  ~Sim() {
    if (fd_ >= 0) close(fd_);
  }

  // The one ready line on standard output.
  std::string readyLine() {
    std::string line;
    size_t pos = 0;
    proc_.out().nextLine(&pos, &line, kTimeoutMs);
    return line;
  }
  bool openPort() {
    if (fd_ >= 0) close(fd_);
    fd_ = open(port_.c_str(), O_RDWR | O_NOCTTY);
    return fd_ >= 0;
  }
  void closePort() {
    close(fd_);
    fd_ = -1;
  }
  void send(const std::string& bytes) { ASSERT_EQ(write(fd_, bytes.data(), bytes.size()), (ssize_t)bytes.size()); }

  // Next line (CR LF ended); "" on time-out or hang-up.
  std::string line() {
    while (true) {
      size_t end = buf_.find("\r\n");
      if (end != std::string::npos) {
        std::string l = buf_.substr(0, end);
        buf_.erase(0, end + 2);
        return l;
      }
      struct pollfd p = {fd_, POLLIN, 0};
      if (poll(&p, 1, kTimeoutMs) <= 0) return "";
      char tmp[512];
      ssize_t n = read(fd_, tmp, sizeof(tmp));
      if (n <= 0) return "";
      buf_.append(tmp, static_cast<size_t>(n));
    }
  }
  // Every line up to and including the final one.
  Lines answer() {
    Lines out;
    while (true) {
      std::string l = line();
      if (l.empty()) return out;
      out.push_back(l);
      if (isFinal(l)) return out;
    }
  }
  Lines command(const std::string& cmd) {
    send(cmd + "\r");
    return answer();
  }
  int terminate() {
    proc_.stop(SIGTERM);
    return proc_.waitExit();
  }
  std::string log() const {
    std::ifstream in(logPath_);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
  }
  const std::string& port() const { return port_; }

 private:
  static std::vector<std::string> withProgram(std::vector<std::string> args, const std::string& root,
                                              const std::string& log) {
    args.insert(args.begin(), {MODEM_SIM_PATH, "--root", root, "--log", log});
    return args;
  }
  se_test::TempRoot root_;
  std::string logPath_, port_, buf_;
  se_test::Process proc_;
  int fd_ = -1;
};

TEST(ModemSimTest, AnswersTheCardCommands) {
  Sim sim({});
  ASSERT_EQ(sim.readyLine().rfind("modem-sim: modem 0 ready on /dev/pts/", 0), 0u);
  ASSERT_TRUE(sim.openPort());
  struct Case {
    std::string cmd;
    Lines expect;
  } cases[] = {
      {"AT", {"OK"}},
      {"at", {"OK"}},
      {"AT^CARDTYPE?", {"^CARDTYPE: 1,1,0", "OK"}},
      {"AT^CARDATR", {"^CARDATR: \"3B86800153452D53494D6B\"", "OK"}},
      // ECHO on channel 1, then the P2 reporter on channel 2 opened with P2 04.
      {"AT+CCHO=\"A00000000101\"", {"+CCHO: 257", "OK"}},
      {"AT+CGLA=257,14,\"00010000021234\"", {"+CGLA: 8,\"12349000\"", "OK"}},
      {"AT+CCHP=\"a00000000103\",4", {"+CCHP: 258", "OK"}},
      {"AT+CGLA=258,10,\"0020000001\"", {"+CGLA: 6,\"049000\"", "OK"}},
      // The modem puts the session's channel into CLA: 00 goes to channel 2.
      {"AT+CGLA=258,16,\"00A4040403010203\"", {"+CGLA: 4,\"6A82\"", "OK"}},
      {"AT+CSIM=10,\"0020000001\"", {"+CSIM: 4,\"6D00\"", "OK"}},
      {"AT+CSIM=10,\"00A4040000\"", {"+CSIM: 40,\"6F108408A000000001000000A5049F6501FF9000\"", "OK"}},
      {"AT+CCHO=\"A000000001FF\"", {"+CME ERROR: 716"}},
      {"AT+CCHC=257", {"OK"}},
      {"AT+CCHC=257", {"ERROR"}},
      {"AT+CGLA=257,10,\"0001000000\"", {"ERROR"}},
      // Malformed: wrong length field, odd hex, bad hex, unquoted, P2 too big.
      {"AT+CGLA=258,12,\"0020000001\"", {"ERROR"}},
      {"AT+CSIM=9,\"002000000\"", {"ERROR"}},
      {"AT+CSIM=10,\"00200000GG\"", {"ERROR"}},
      {"AT+CCHO=A00000000101", {"ERROR"}},
      {"AT+CCHP=\"A00000000101\",256", {"ERROR"}},
      {"AT+CCHO=\"\"", {"ERROR"}},
      {"AT+CSIM=0,\"\"", {"ERROR"}},
      {"AT+COPS?", {"ERROR"}},
      {"ATD123;", {"ERROR"}},
  };
  for (const Case& c : cases) EXPECT_EQ(sim.command(c.cmd), c.expect) << c.cmd;
  // The log shows what came in and what went out.
  const std::string log = sim.log();
  EXPECT_NE(log.find("< AT+CCHP=\"a00000000103\",4\n"), std::string::npos);
  EXPECT_NE(log.find("> +CCHP: 258\n"), std::string::npos);
}

TEST(ModemSimTest, LongAnswersAndChannelExhaustion) {
  Sim sim({"--channels", "3", "--session-base", "512"});
  sim.readyLine();
  ASSERT_TRUE(sim.openPort());
  EXPECT_EQ(sim.command("AT+CCHO=\"A00000000102\""), (Lines{"+CCHO: 513", "OK"}));
  EXPECT_EQ(sim.command("AT+CGLA=513,8,\"00100000\""), (Lines{"+CGLA: 4,\"6100\"", "OK"}));
  Lines l = sim.command("AT+CGLA=513,10,\"00C0000000\"");
  ASSERT_EQ(l.size(), 2u);
  EXPECT_EQ(l[0].rfind("+CGLA: 516,\"000102", 0), 0u);
  EXPECT_EQ(l[0].substr(l[0].size() - 5), "612C\"");
  EXPECT_EQ(sim.command("AT+CCHO=\"A00000000101\""), (Lines{"+CCHO: 514", "OK"}));
  EXPECT_EQ(sim.command("AT+CCHO=\"A00000000101\""), (Lines{"+CME ERROR: 717"}));
  EXPECT_EQ(sim.command("AT+CCHC=514"), (Lines{"OK"}));
  EXPECT_EQ(sim.command("AT+CCHO=\"A00000000103\""), (Lines{"+CCHO: 514", "OK"}));
}

TEST(ModemSimTest, SurvivesTheClientClosingAndStopsOnSigterm) {
  Sim sim({});
  sim.readyLine();
  ASSERT_TRUE(sim.openPort());
  EXPECT_EQ(sim.command("AT+CCHO=\"A00000000101\""), (Lines{"+CCHO: 257", "OK"}));
  sim.closePort();
  ASSERT_TRUE(sim.openPort());
  // Same card, same session, after the reopen.
  EXPECT_EQ(sim.command("AT+CGLA=257,12,\"000100000155\""), (Lines{"+CGLA: 6,\"559000\"", "OK"}));
  sim.closePort();
  EXPECT_EQ(sim.terminate(), 0);
  struct stat st;
  EXPECT_NE(lstat(sim.port().c_str(), &st), 0) << "link left behind";
}

TEST(ModemSimTest, InputSplitAnyhowAndLineEndings) {
  Sim sim({});
  sim.readyLine();
  ASSERT_TRUE(sim.openPort());
  // One byte at a time, with CR LF; then two commands in one write with LF only.
  for (char c : std::string("AT^CARDTYPE?\r\n")) sim.send(std::string(1, c));
  EXPECT_EQ(sim.answer(), (Lines{"^CARDTYPE: 1,1,0", "OK"}));
  sim.send("AT\nAT+CSIM=8,\"00CA0066\"\n");
  EXPECT_EQ(sim.answer(), (Lines{"OK"}));
  EXPECT_EQ(sim.answer(), (Lines{"+CSIM: 20,\"66067304060201019000\"", "OK"}));
  // An over-long line is dropped whole and answered with ERROR at its end.
  sim.send("AT+CSIM=" + std::string(10000, '0') + "\r");
  EXPECT_EQ(sim.answer(), (Lines{"ERROR"}));
  EXPECT_EQ(sim.command("AT"), (Lines{"OK"}));
}

TEST(ModemSimTest, CardAbsent) {
  Sim sim({"--card-absent"});
  sim.readyLine();
  ASSERT_TRUE(sim.openPort());
  EXPECT_EQ(sim.command("AT^CARDTYPE?"), (Lines{"^CARDTYPE: 0,0,0", "OK"}));
  EXPECT_EQ(sim.command("AT^CARDATR"), (Lines{"+CME ERROR: 10"}));
  EXPECT_EQ(sim.command("AT+CCHO=\"A00000000101\""), (Lines{"+CME ERROR: 10"}));
  EXPECT_EQ(sim.command("AT+CSIM=8,\"00CA0066\""), (Lines{"+CME ERROR: 10"}));
}

TEST(ModemSimTest, SecondModemAndOwnAtr) {
  Sim sim({"--modem", "1", "--atr", "3b00"}, 1);
  EXPECT_EQ(sim.readyLine().rfind("modem-sim: modem 1 ready on ", 0), 0u);
  ASSERT_TRUE(sim.openPort());
  EXPECT_EQ(sim.command("AT^CARDATR"), (Lines{"^CARDATR: \"3B00\"", "OK"}));
}

TEST(ModemSimTest, PiecesDelaysAndInjectedLines) {
  Sim sim({"--split", "3", "--delay", "5", "--unsol", "1", "--sms-pairs"});
  sim.readyLine();
  ASSERT_TRUE(sim.openPort());
  // Injected lines come before the final line of every answer.
  EXPECT_EQ(sim.command("AT^CARDTYPE?"),
            (Lines{"^CARDTYPE: 1,1,0", "+CREG: 1", "+CMT: ,24", "0011000B916407281553F80000AA0BE8329BFD4697D9EC377D",
                   "OK"}));
  Lines l = sim.command("AT");
  ASSERT_EQ(l.size(), 4u);
  EXPECT_EQ(l[0], "^RSSI: 20");
  EXPECT_EQ(l[1], "+CMT: ,24");
  EXPECT_EQ(l[3], "OK");
}

TEST(ModemSimTest, SilentOnAChosenCommand) {
  Sim sim({"--silent-on", "at+csim"});
  sim.readyLine();
  ASSERT_TRUE(sim.openPort());
  sim.send("AT+CSIM=8,\"00CA0066\"\r");
  // Nothing for the silent command: the next line is the answer to AT.
  EXPECT_EQ(sim.command("AT"), (Lines{"OK"}));
  EXPECT_NE(sim.log().find("< AT+CSIM=8"), std::string::npos);
}

TEST(ModemSimTest, ClosesThePortAfterNCommands) {
  Sim sim({"--close-after", "2"});
  sim.readyLine();
  ASSERT_TRUE(sim.openPort());
  EXPECT_EQ(sim.command("AT"), (Lines{"OK"}));
  EXPECT_EQ(sim.command("AT"), (Lines{"OK"}));
  // The port hangs up: the read ends instead of timing out.
  auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(sim.line(), "");
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(kTimeoutMs));
  struct stat st;
  EXPECT_NE(lstat(sim.port().c_str(), &st), 0);
  EXPECT_EQ(sim.terminate(), 0);
}

// The answer forms a real modem may use instead of the default ones.
TEST(ModemSimTest, BareOpenAnswersAndShortLengthFields) {
  struct Case {
    std::vector<std::string> options;
    std::vector<std::pair<std::string, Lines>> exchanges;
  };
  const Case cases[] = {
      {{"--bare-open"},
       {{"AT+CCHO=\"A00000000101\"", {"257", "OK"}},
        {"AT+CCHP=\"A00000000103\",4", {"258", "OK"}},
        {"AT+CCHO=\"A000000001FF\"", {"+CME ERROR: 716"}},
        {"AT+CGLA=257,12,\"000100000155\"", {"+CGLA: 6,\"559000\"", "OK"}}}},
      {{"--short-length"},
       {{"AT+CCHO=\"A00000000101\"", {"+CCHO: 257", "OK"}},
        {"AT+CGLA=257,12,\"000100000155\"", {"+CGLA: 4,\"559000\"", "OK"}},
        {"AT+CGLA=257,10,\"0002900000\"", {"+CGLA: 2,\"9000\"", "OK"}},
        {"AT+CSIM=10,\"0020000001\"", {"+CSIM: 2,\"6D00\"", "OK"}}}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.options[0]);
    Sim sim(c.options);
    sim.readyLine();
    ASSERT_TRUE(sim.openPort());
    for (const auto& e : c.exchanges) EXPECT_EQ(sim.command(e.first), e.second) << e.first;
  }
}

int runTool(const std::vector<std::string>& args, std::string* out) {
  std::string cmd = MODEM_SIM_PATH;
  for (const auto& a : args) cmd += " " + a;
  cmd += " 2>&1";
  FILE* p = popen(cmd.c_str(), "r");
  char buf[512];
  size_t n;
  while ((n = fread(buf, 1, sizeof(buf), p)) > 0) out->append(buf, n);
  int status = pclose(p);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST(ModemSimTest, HelpAndBadOptions) {
  std::string out;
  EXPECT_EQ(runTool({"--help"}, &out), 0);
  EXPECT_NE(out.find("--silent-on"), std::string::npos);
  EXPECT_NE(out.find("--bare-open"), std::string::npos);
  EXPECT_NE(out.find("--short-length"), std::string::npos);
  EXPECT_EQ(runTool({"--modem", "2"}, &out), 2);
  EXPECT_EQ(runTool({"--atr", "3B0"}, &out), 2);
  EXPECT_EQ(runTool({"--bogus"}, &out), 2);
}

}  // namespace

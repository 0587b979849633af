// modem-sim as a real process over its pty.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <termios.h>
#include <unistd.h>

#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "se_harness.h"

namespace {

using Lines = std::vector<std::string>;
constexpr int kTimeoutMs = 5000;

// modem-sim in a fresh device root, logging to a file, its port opened as
// the daemon would open it once the ready line is out: a terminal put in
// raw mode.
class Sim {
 public:
  explicit Sim(std::vector<std::string> args, int modem = 0)
      : port_(root_.at(modem == 0 ? "dev/appvcom18" : "dev/appvcom34")), proc_(argv(args), root_.path()) {
    size_t pos = 0;
    proc_.out().nextLine(&pos, &ready_, kTimeoutMs);
    openPort();
  }
  ~Sim() { closePort(); }
  const std::string& ready() const { return ready_; }
  bool openPort() {
    closePort();
    fd_ = open(port_.c_str(), O_RDWR | O_NOCTTY);
    struct termios t;
    if (fd_ < 0 || tcgetattr(fd_, &t) != 0) return false;
    echoedAtOpen_ = (t.c_lflag & ECHO) != 0;
    canonicalAtOpen_ = (t.c_lflag & ICANON) != 0;
    cfmakeraw(&t);
    return tcsetattr(fd_, TCSANOW, &t) == 0;
  }
  // The terminal settings the port had before this client set them.
  bool echoedAtOpen() const { return echoedAtOpen_; }
  bool canonicalAtOpen() const { return canonicalAtOpen_; }
  void closePort() {
    if (fd_ >= 0) close(fd_);
    fd_ = -1;
  }
  void send(const std::string& bytes) { ASSERT_EQ(write(fd_, bytes.data(), bytes.size()), (ssize_t)bytes.size()); }
  // Next line (ended by CR or LF, empty ones skipped); "" on time-out or
  // hang-up.
  std::string line() {
    for (;;) {
      buf_.erase(0, buf_.find_first_not_of("\r\n"));
      const size_t end = buf_.find_first_of("\r\n");
      if (end != std::string::npos) {
        std::string l = buf_.substr(0, end);
        buf_.erase(0, end + 1);
        return l;
      }
      pollfd p = {fd_, POLLIN, 0};
      char tmp[512];
      const ssize_t n = poll(&p, 1, kTimeoutMs) > 0 ? read(fd_, tmp, sizeof(tmp)) : 0;
      if (n <= 0) return "";
      buf_.append(tmp, static_cast<size_t>(n));
    }
  }
  // Every line up to and including the final one.
  Lines answer() {
    Lines out;
    for (std::string l = line(); !l.empty(); l = line()) {
      out.push_back(l);
      if (l == "OK" || l == "ERROR" || l.rfind("+CME ERROR:", 0) == 0) break;
    }
    return out;
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
    std::stringstream ss;
    ss << std::ifstream(root_.at("sim.log")).rdbuf();
    return ss.str();
  }
  bool portLinkGone() const {
    struct stat st;
    return lstat(port_.c_str(), &st) != 0;
  }

 private:
  std::vector<std::string> argv(std::vector<std::string> args) const {
    args.insert(args.begin(), {MODEM_SIM_PATH, "--root", root_.path(), "--log", root_.at("sim.log")});
    return args;
  }
  se_test::TempRoot root_;
  std::string port_, buf_, ready_;
  se_test::Process proc_;
  int fd_ = -1;
  bool echoedAtOpen_ = false;
  bool canonicalAtOpen_ = false;
};

TEST(ModemSimTest, AnswersTheCardCommands) {
  Sim sim({});
  ASSERT_EQ(sim.ready().rfind("modem-sim: modem 0 ready on /dev/pts/", 0), 0u);
  const std::pair<std::string, Lines> cases[] = {
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
  for (const auto& [cmd, expect] : cases) EXPECT_EQ(sim.command(cmd), expect) << cmd;
  // The log shows what came in and what went out.
  EXPECT_NE(sim.log().find("< AT+CCHP=\"a00000000103\",4\n> +CCHP: 258\n"), std::string::npos) << sim.log();
}

// Each option against the commands it changes. An exchange expecting no
// lines is sent without waiting for an answer.
TEST(ModemSimTest, Options) {
  std::string big = "+CGLA: 516,\"";
  for (int i = 0; i < 256; ++i) big += se_test::hexByte(i);
  struct Case {
    std::vector<std::string> options;
    int modem;
    std::vector<std::pair<std::string, Lines>> exchanges;
  };
  const Case cases[] = {
      {{"--channels", "3", "--session-base", "512"}, 0,
       {{"AT+CCHO=\"A00000000102\"", {"+CCHO: 513", "OK"}},
        {"AT+CGLA=513,8,\"00100000\"", {"+CGLA: 4,\"6100\"", "OK"}},
        {"AT+CGLA=513,10,\"00C0000000\"", {big + "612C\"", "OK"}},
        {"AT+CCHO=\"A00000000101\"", {"+CCHO: 514", "OK"}},
        {"AT+CCHO=\"A00000000101\"", {"+CME ERROR: 717"}},
        {"AT+CCHC=514", {"OK"}},
        {"AT+CCHO=\"A00000000103\"", {"+CCHO: 514", "OK"}}}},
      {{"--card-absent"}, 0,
       {{"AT^CARDTYPE?", {"^CARDTYPE: 0,0,0", "OK"}},
        {"AT^CARDATR", {"+CME ERROR: 10"}},
        {"AT+CCHO=\"A00000000101\"", {"+CME ERROR: 10"}},
        {"AT+CSIM=8,\"00CA0066\"", {"+CME ERROR: 10"}}}},
      {{"--modem", "1", "--atr", "3b00"}, 1, {{"AT^CARDATR", {"^CARDATR: \"3B00\"", "OK"}}}},
      // Injected lines come before the final line of every answer.
      {{"--split", "3", "--delay", "5", "--unsol", "1", "--sms-pairs"}, 0,
       {{"AT^CARDTYPE?",
         {"^CARDTYPE: 1,1,0", "+CREG: 1", "+CMT: ,24", "0011000B916407281553F80000AA0BE8329BFD4697D9EC377D", "OK"}},
        {"AT", {"^RSSI: 20", "+CMT: ,24", "0011000B916407281553F80000AA0BE8329BFD4697D9EC377D", "OK"}}}},
      // Nothing for the silent command: the next line is the answer to AT.
      {{"--silent-on", "at+csim"}, 0, {{"AT+CSIM=8,\"00CA0066\"", {}}, {"AT", {"OK"}}}},
      {{"--bare-open"}, 0,
       {{"AT+CCHO=\"A00000000101\"", {"257", "OK"}},
        {"AT+CCHP=\"A00000000103\",4", {"258", "OK"}},
        {"AT+CCHO=\"A000000001FF\"", {"+CME ERROR: 716"}},
        {"AT+CGLA=257,12,\"000100000155\"", {"+CGLA: 6,\"559000\"", "OK"}}}},
      // Real modems' habits: error forms, no vendor queries, command echo.
      {{"--errors", "verbose", "--card-absent"}, 0,
       {{"AT+CPIN?", {"+CME ERROR: SIM not inserted"}},
        {"AT^CARDATR", {"+CME ERROR: SIM not inserted"}}}},
      {{"--errors", "verbose"}, 0,
       {{"AT+CPIN?", {"+CPIN: READY", "OK"}}, {"AT+CCHO=\"A000000001FF\"", {"+CME ERROR: unknown"}}}},
      {{"--errors", "bare", "--card-absent"}, 0,
       {{"AT+CPIN?", {"ERROR"}}, {"AT+CCHO=\"A00000000101\"", {"ERROR"}}}},
      {{"--no-vendor-queries"}, 0,
       {{"AT^CARDTYPE?", {"ERROR"}}, {"AT^CARDATR", {"ERROR"}}, {"AT+CPIN?", {"+CPIN: READY", "OK"}}}},
      {{"--echo"}, 0,
       {{"AT", {"AT", "OK"}}, {"AT^CARDTYPE?", {"AT^CARDTYPE?", "^CARDTYPE: 1,1,0", "OK"}}}},
      {{"--profile", "usb"}, 0,
       {{"AT^CARDTYPE?", {"AT^CARDTYPE?", "ERROR"}},
        {"AT+CPIN?", {"AT+CPIN?", "+CPIN: READY", "OK"}},
        {"AT+CCHO=\"A000000001FF\"", {"AT+CCHO=\"A000000001FF\"", "+CME ERROR: unknown"}}}},
      {{"--short-length"}, 0,
       {{"AT+CCHO=\"A00000000101\"", {"+CCHO: 257", "OK"}},
        {"AT+CGLA=257,12,\"000100000155\"", {"+CGLA: 4,\"559000\"", "OK"}},
        {"AT+CGLA=257,10,\"0002900000\"", {"+CGLA: 2,\"9000\"", "OK"}},
        {"AT+CSIM=10,\"0020000001\"", {"+CSIM: 2,\"6D00\"", "OK"}}}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.options[0] + " " + c.options.back());
    Sim sim(c.options, c.modem);
    EXPECT_EQ(sim.ready().rfind("modem-sim: modem " + std::to_string(c.modem) + " ready on ", 0), 0u);
    // Only a modem left as plugged in hands its client a cooked terminal.
    const bool cooked = c.options[0] == "--profile";
    EXPECT_EQ(sim.echoedAtOpen(), cooked);
    EXPECT_EQ(sim.canonicalAtOpen(), cooked);
    for (const auto& [cmd, expect] : c.exchanges) {
      if (expect.empty()) {
        sim.send(cmd + "\r");
      } else {
        EXPECT_EQ(sim.command(cmd), expect) << cmd;
      }
    }
  }
}

TEST(ModemSimTest, SurvivesTheClientClosingAndStopsOnSigterm) {
  Sim sim({});
  EXPECT_EQ(sim.command("AT+CCHO=\"A00000000101\""), (Lines{"+CCHO: 257", "OK"}));
  ASSERT_TRUE(sim.openPort());
  // Same card, same session, after the reopen.
  EXPECT_EQ(sim.command("AT+CGLA=257,12,\"000100000155\""), (Lines{"+CGLA: 6,\"559000\"", "OK"}));
  sim.closePort();
  EXPECT_EQ(sim.terminate(), 0);
  EXPECT_TRUE(sim.portLinkGone());
}

TEST(ModemSimTest, InputSplitAnyhowAndLineEndings) {
  Sim sim({});
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

TEST(ModemSimTest, ClosesThePortAfterNCommands) {
  Sim sim({"--close-after", "2"});
  EXPECT_EQ(sim.command("AT"), (Lines{"OK"}));
  EXPECT_EQ(sim.command("AT"), (Lines{"OK"}));
  // The port hangs up: the read ends with nothing, the link is gone.
  EXPECT_EQ(sim.line(), "");
  EXPECT_TRUE(sim.portLinkGone());
  EXPECT_EQ(sim.terminate(), 0);
}

TEST(ModemSimTest, HelpAndBadOptions) {
  const std::pair<std::vector<std::string>, int> rows[] = {
      {{"--help"}, 0}, {{"--modem", "2"}, 2}, {{"--atr", "3B0"}, 2}, {{"--bogus"}, 2},
      {{"--errors", "loud"}, 2}, {{"--profile", "pcie"}, 2}};
  for (const auto& [args, code] : rows) {
    std::vector<std::string> argv{MODEM_SIM_PATH};
    argv.insert(argv.end(), args.begin(), args.end());
    se_test::Process p(argv, "/");
    EXPECT_EQ(p.waitExit(), code) << args[0];
    for (const char* o : {"--silent-on", "--bare-open", "--short-length", "--tty-defaults", "--profile usb"})
      EXPECT_EQ(p.out().text().find(o) != std::string::npos, code == 0) << o;
  }
}

}  // namespace

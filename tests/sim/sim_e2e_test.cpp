// End to end on "SIM1": the real daemon, one or two modem-sim processes and
// secli, all in a fresh device root. Every process started here is killed
// when its owner goes out of scope, and with the test process should it die
// (parent-death signal).
#include <gtest/gtest.h>

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <fstream>
#include <memory>
#include <mutex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "test_root.h"

namespace {

constexpr int kGenerousMs = 20000;
constexpr const char* kEchoAid = "A00000000101";
constexpr const char* kP2Aid = "A00000000103";

// A child process whose standard output and error are collected.
class Process {
 public:
  explicit Process(const std::vector<std::string>& argv) {
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0) return;
    std::vector<char*> args;
    for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    pid_t parent = getpid();
    pid_ = fork();
    if (pid_ == 0) {
      prctl(PR_SET_PDEATHSIG, SIGKILL);
      if (getppid() != parent) _exit(127);
      dup2(fds[1], 1);
      dup2(fds[1], 2);
      execv(args[0], args.data());
      _exit(127);
    }
    close(fds[1]);
    fd_ = fds[0];
    reader_ = std::thread([this] { run(); });
  }
  ~Process() {
    stop(SIGKILL);
    if (reader_.joinable()) reader_.join();
    if (fd_ >= 0) close(fd_);
  }
  Process(const Process&) = delete;
  Process& operator=(const Process&) = delete;

  // Signals the process and reaps it; returns its wait status.
  int stop(int sig) {
    if (pid_ > 0 && !reaped_) {
      kill(pid_, sig);
      waitpid(pid_, &status_, 0);
      reaped_ = true;
      waitEof(kGenerousMs);  // everything it wrote is in text() now
    }
    return status_;
  }
  // Waits for the process to exit on its own; false when it did not in time.
  bool waitExit(int* exitCode, int ms = kGenerousMs) {
    if (!waitEof(ms)) return false;
    waitpid(pid_, &status_, 0);
    reaped_ = true;
    *exitCode = WIFEXITED(status_) ? WEXITSTATUS(status_) : -1;
    return true;
  }
  bool waitFor(const std::string& needle, int ms = kGenerousMs) {
    std::unique_lock<std::mutex> l(mu_);
    return cv_.wait_for(l, std::chrono::milliseconds(ms),
                        [&] { return text_.find(needle) != std::string::npos; });
  }
  std::string text() {
    std::lock_guard<std::mutex> l(mu_);
    return text_;
  }

 private:
  bool waitEof(int ms) {
    std::unique_lock<std::mutex> l(mu_);
    return cv_.wait_for(l, std::chrono::milliseconds(ms), [&] { return eof_; });
  }
  void run() {
    char buf[4096];
    for (;;) {
      ssize_t n = read(fd_, buf, sizeof(buf));
      if (n < 0 && errno == EINTR) continue;
      std::lock_guard<std::mutex> l(mu_);
      if (n <= 0) {
        eof_ = true;
        cv_.notify_all();
        return;
      }
      text_.append(buf, static_cast<size_t>(n));
      cv_.notify_all();
    }
  }

  pid_t pid_ = -1;
  int fd_ = -1;
  int status_ = 0;
  bool reaped_ = false;
  std::mutex mu_;
  std::condition_variable cv_;
  std::string text_;
  bool eof_ = false;
  std::thread reader_;
};

// Polls a file another process appends to, with a generous deadline.
bool fileContains(const std::string& path, const std::string& needle, int ms = kGenerousMs) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
  for (;;) {
    std::ifstream in(path);
    std::string content((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    if (content.find(needle) != std::string::npos) return true;
    if (std::chrono::steady_clock::now() > deadline) return false;
    poll(nullptr, 0, 10);
  }
}

std::string fileText(const std::string& path) {
  std::ifstream in(path);
  return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

size_t countOf(const std::string& text, const std::string& needle) {
  size_t n = 0;
  for (size_t pos = text.find(needle); pos != std::string::npos; pos = text.find(needle, pos + 1)) n++;
  return n;
}

class SimEndToEnd : public ::testing::Test {
 protected:
  void startModem(int modem, std::vector<std::string> extra = {}) {
    std::vector<std::string> argv = {MODEM_SIM_PATH, "--root", root_.path(), "--modem",
                                     std::to_string(modem), "--log", modemLog(modem)};
    argv.insert(argv.end(), extra.begin(), extra.end());
    modems_.push_back(std::make_unique<Process>(argv));
    ASSERT_TRUE(modems_.back()->waitFor("ready")) << modems_.back()->text();
  }
  void startDaemon() {
    daemon_ = std::make_unique<Process>(std::vector<std::string>{DAEMON_PATH});
    // "list --wait" returns with the first instance; SIM1 may come second.
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kGenerousMs);
    std::string out;
    do {
      int code = -1;
      out = secli({"list", "--wait", "15"}, &code);
      if (out.find("SIM1") != std::string::npos) return;
      poll(nullptr, 0, 20);
    } while (std::chrono::steady_clock::now() < deadline);
    FAIL() << "SIM1 not registered: " << out << daemon_->text();
  }
  std::string modemLog(int modem) const { return root_.at("modem" + std::to_string(modem) + ".log"); }

  // Runs secli to its end and returns its output.
  std::string secli(const std::vector<std::string>& args, int* exitCode) {
    std::vector<std::string> argv = {SECLI_PATH, "--root", root_.path(), "--timeout", "20"};
    argv.insert(argv.end(), args.begin(), args.end());
    Process p(argv);
    *exitCode = -1;
    EXPECT_TRUE(p.waitExit(exitCode)) << p.text();
    return p.text();
  }
  // Runs a secli script on SIM1 over one connection, JSON output.
  std::string script(const std::string& lines) {
    static int n = 0;
    std::string path = root_.at("script" + std::to_string(n++) + ".txt");
    root_.writeFile(path.substr(root_.path().size() + 1), lines);
    int code = -1;
    std::string out = secli({"--json", "-i", "SIM1", "-f", path}, &code);
    EXPECT_EQ(0, code) << out;
    return out;
  }
  void TearDown() override {
    // The daemon first, so that no port is in use when the modems go.
    if (daemon_) daemon_->stop(SIGKILL);
    for (auto& m : modems_) m->stop(SIGTERM);
    // In sanitizer builds the daemon reports problems on its output and goes on.
    if (daemon_) {
      for (const char* report : {"ThreadSanitizer", "AddressSanitizer", "runtime error"}) {
        EXPECT_EQ(std::string::npos, daemon_->text().find(report)) << report;
      }
    }
    if (HasFailure() && daemon_) std::cerr << "daemon output:\n" << daemon_->text();
  }

  sim_test::TestRoot root_;
  std::vector<std::unique_ptr<Process>> modems_;
  std::unique_ptr<Process> daemon_;
};

TEST_F(SimEndToEnd, OneModemChannelsAndApdus) {
  startModem(0);
  startDaemon();
  std::string out = script(std::string("init\npresent\natr\n") +
                           "open " + kP2Aid + " 0x7F\n" +   // channel 1, SELECT with P2 00
                           "transmit 01 20 00 00 00\n" +      // the P2 applet reports 00
                           "open " + kEchoAid + " 0x00\n" +   // channel 2
                           "transmit 02 01 00 00 02 AB CD\n" +
                           "transmit 00 CA 9F 7F 00\n" +      // basic channel, AT+CSIM
                           "close 1\nclose 2\n" +
                           "transmit 02 01 00 00 01 AA\n" +   // closed: empty answer
                           "basic " + kEchoAid + "\n");
  std::istringstream lines(out);
  std::vector<std::string> l;
  for (std::string s; std::getline(lines, s);) l.push_back(s);
  ASSERT_EQ(12u, l.size()) << out;
  EXPECT_EQ("{\"cmd\":\"init\",\"state\":true}", l[0]);
  EXPECT_EQ("{\"cmd\":\"present\",\"present\":true}", l[1]);
  EXPECT_NE(std::string::npos, l[2].find("\"atr\":\"3B")) << l[2];
  EXPECT_NE(std::string::npos, l[3].find("\"status\":\"SUCCESS\",\"channel\":1")) << l[3];
  EXPECT_NE(std::string::npos, l[4].find("\"response\":\"009000\"")) << l[4];
  EXPECT_NE(std::string::npos, l[5].find("\"status\":\"SUCCESS\",\"channel\":2")) << l[5];
  EXPECT_NE(std::string::npos, l[6].find("\"response\":\"ABCD9000\"")) << l[6];
  EXPECT_NE(std::string::npos, l[7].find("\"response\":\"9F7F")) << l[7];
  EXPECT_NE(std::string::npos, l[8].find("\"status\":\"SUCCESS\"")) << l[8];
  EXPECT_NE(std::string::npos, l[9].find("\"status\":\"SUCCESS\"")) << l[9];
  EXPECT_NE(std::string::npos, l[10].find("\"response\":\"\"")) << l[10];
  EXPECT_NE(std::string::npos, l[11].find("\"status\":\"CHANNEL_NOT_AVAILABLE\"")) << l[11];

  std::string log = fileText(modemLog(0));
  for (const char* sent : {"< AT+CCHO=\"A00000000103\"", "< AT+CGLA=257,22,\"00A4040006A00000000103\"",
                           "< AT+CCHP=\"A00000000101\",0", "< AT+CGLA=257,10,\"0120000000\"",
                           "< AT+CSIM=10,\"00CA9F7F00\"", "< AT+CCHC=257", "< AT+CCHC=258"}) {
    EXPECT_NE(std::string::npos, log.find(sent)) << sent << "\n" << log;
  }
}

TEST_F(SimEndToEnd, TwoModemsFollowTheSwitchAndTheSlotOrder) {
  root_.writeFile("properties", "ro.odm.config.modem_number=2\n");
  for (const char* node : {"nfc_sim_switch", "nfc_card_num", "nfc_wired_ese_type"}) {
    root_.writeFile(std::string("sys/nfc/") + node, "0");
  }
  startModem(0);
  startModem(1, {"--card-absent"});
  startDaemon();
  EXPECT_NE(std::string::npos, script("init\n").find("\"state\":true"));

  // NFC on SIM 1, normal slot order: modem 0, whose card is there.
  EXPECT_NE(std::string::npos, script("present\n").find("\"present\":true"));
  // Switched to SIM 2: modem 1, without a card.
  root_.writeFile("sys/nfc/nfc_sim_switch", "2");
  root_.writeFile("sys/nfc/nfc_card_num", "3");
  EXPECT_NE(std::string::npos, script("present\n").find("\"present\":false"));
  // Slots swapped: SIM 2 is on modem 0 again.
  root_.appendFile("properties", "persist.odm.radio.sim_slot_cfg=1,0\n");
  EXPECT_NE(std::string::npos, script("present\n").find("\"present\":true"));

  EXPECT_EQ(2u, countOf(fileText(modemLog(0)), "< AT^CARDTYPE?"));
  EXPECT_EQ(1u, countOf(fileText(modemLog(1)), "< AT^CARDTYPE?"));
}

TEST_F(SimEndToEnd, NewInitAfterAKilledClientClosesChannelsFromThree) {
  startModem(0);
  startDaemon();
  std::string path = root_.at("held.txt");
  std::string lines = "init\n";
  for (int i = 0; i < 4; i++) lines += std::string("open ") + kEchoAid + " 0x00\n";
  lines += "sleep 600000\n";
  root_.writeFile("held.txt", lines);
  {
    Process client({SECLI_PATH, "--root", root_.path(), "--json", "-i", "SIM1", "-f", path});
    ASSERT_TRUE(client.waitFor("\"channel\":4")) << client.text();
    client.stop(SIGKILL);
  }
  ASSERT_TRUE(daemon_->waitFor("serviceDied, enter")) << daemon_->text();
  ASSERT_TRUE(fileContains(modemLog(0), "< AT+CGLA=260,"));
  EXPECT_EQ(0u, countOf(fileText(modemLog(0)), "AT+CCHC="));

  EXPECT_NE(std::string::npos, script("init\n").find("\"state\":true"));
  std::string log = fileText(modemLog(0));
  EXPECT_EQ(2u, countOf(log, "< AT+CCHC=")) << log;
  EXPECT_NE(std::string::npos, log.find("< AT+CCHC=259"));
  EXPECT_NE(std::string::npos, log.find("< AT+CCHC=260"));
  // Channels 1 and 2 stay open and usable.
  EXPECT_NE(std::string::npos,
            script("transmit 01 01 00 00 01 11\ntransmit 02 01 00 00 01 22\n").find("\"response\":\"229000\""));
  EXPECT_NE(std::string::npos, script("transmit 03 01 00 00 01 33\n").find("\"response\":\"\""));
}

}  // namespace

// End to end: the real daemon with the simulated vendor library in a fresh
// device root, driven by the real secli over the daemon's sockets. Every
// process started here is killed when its owner goes out of scope, and dies
// with the test process (parent-death signal) if the test itself crashes.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstring>
#include <fstream>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

namespace {

constexpr int kGenerousMs = 15000;

// The card's applets (card/card_applets.h).
constexpr const char* kEchoAid = "A00000000101";
constexpr const char* kBigAid = "A00000000102";
constexpr const char* kP2Aid = "A00000000103";
constexpr const char* kMissingAid = "A00000000199";

// A sanitizer build reports into the process's standard error and may keep
// running; such a report fails the test.
void expectNoSanitizerReport(const std::string& who, const std::string& err) {
  for (const char* mark : {"ERROR: AddressSanitizer", "ERROR: LeakSanitizer",
                           "WARNING: ThreadSanitizer", "runtime error:"}) {
    EXPECT_EQ(err.find(mark), std::string::npos) << who << ":\n" << err;
  }
}

// Collects everything a child writes to one pipe; waits are on a condition
// the reader thread signals, never on a clock alone.
class PipeReader {
 public:
  explicit PipeReader(int fd) : fd_(fd), thread_([this] { run(); }) {}
  ~PipeReader() {
    thread_.join();
    close(fd_);
  }
  std::string text() {
    std::lock_guard<std::mutex> l(mu_);
    return text_;
  }
  // True once `needle` appears at or after byte `from`.
  bool waitFor(const std::string& needle, size_t from = 0, int ms = kGenerousMs) {
    std::unique_lock<std::mutex> l(mu_);
    return cv_.wait_for(l, std::chrono::milliseconds(ms), [&] {
      return text_.size() >= from && text_.find(needle, from) != std::string::npos;
    });
  }
  // The next complete line after byte `*pos`, moving `*pos` past it.
  bool nextLine(size_t* pos, std::string* line, int ms = kGenerousMs) {
    std::unique_lock<std::mutex> l(mu_);
    const bool ok = cv_.wait_for(l, std::chrono::milliseconds(ms), [&] {
      return text_.find('\n', *pos) != std::string::npos;
    });
    if (!ok) return false;
    const size_t nl = text_.find('\n', *pos);
    *line = text_.substr(*pos, nl - *pos);
    *pos = nl + 1;
    return true;
  }
  bool waitEof(int ms = kGenerousMs) {
    std::unique_lock<std::mutex> l(mu_);
    return cv_.wait_for(l, std::chrono::milliseconds(ms), [&] { return eof_; });
  }

 private:
  void run() {
    char buf[4096];
    for (;;) {
      const ssize_t n = read(fd_, buf, sizeof(buf));
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
  int fd_;
  std::mutex mu_;
  std::condition_variable cv_;
  std::string text_;
  bool eof_ = false;
  std::thread thread_;
};

// One child process with its standard input, output and error on pipes.
class Child {
 public:
  Child(const std::vector<std::string>& argv, const std::string& deviceRoot) {
    int in[2], out[2], err[2];
    if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0)
      throw std::runtime_error("pipe");
    // Everything exec needs is built before fork: the child may only make
    // async-signal-safe calls.
    std::vector<std::string> envText;
    for (char** e = environ; *e; ++e) {
      if (strncmp(*e, "SE_DEVICE_ROOT=", 15) != 0) envText.emplace_back(*e);
    }
    envText.push_back("SE_DEVICE_ROOT=" + deviceRoot);
    std::vector<char*> envp;
    for (auto& s : envText) envp.push_back(&s[0]);
    envp.push_back(nullptr);
    std::vector<std::string> args = argv;
    std::vector<char*> argp;
    for (auto& s : args) argp.push_back(&s[0]);
    argp.push_back(nullptr);
    const pid_t parent = getpid();

    pid_ = fork();
    if (pid_ < 0) throw std::runtime_error("fork");
    if (pid_ == 0) {
      prctl(PR_SET_PDEATHSIG, SIGKILL);
      if (getppid() != parent) _exit(127);
      dup2(in[0], 0);
      dup2(out[1], 1);
      dup2(err[1], 2);
      execve(argp[0], argp.data(), envp.data());
      _exit(127);
    }
    close(in[0]);
    close(out[1]);
    close(err[1]);
    stdin_ = in[1];
    out_ = std::make_unique<PipeReader>(out[0]);
    err_ = std::make_unique<PipeReader>(err[0]);
  }
  ~Child() {
    closeStdin();
    if (pid_ > 0 && !reaped_) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
    out_.reset();
    err_.reset();
  }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;

  void write(const std::string& text) {
    const char* p = text.data();
    size_t left = text.size();
    while (left > 0) {
      const ssize_t n = ::write(stdin_, p, left);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return;
      p += n;
      left -= static_cast<size_t>(n);
    }
  }
  void closeStdin() {
    if (stdin_ >= 0) close(stdin_);
    stdin_ = -1;
  }
  void killNow() {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
    reaped_ = true;
  }
  // Exit status once its output has ended; -1 when it did not end in time.
  int waitExit() {
    if (!out_->waitEof() || !err_->waitEof()) return -1;
    int status = 0;
    if (waitpid(pid_, &status, 0) != pid_) return -1;
    reaped_ = true;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }
  PipeReader& out() { return *out_; }
  PipeReader& err() { return *err_; }

 private:
  pid_t pid_ = -1;
  bool reaped_ = false;
  int stdin_ = -1;
  std::unique_ptr<PipeReader> out_;
  std::unique_ptr<PipeReader> err_;
};

// A secli reading commands from its standard input, one JSON line back for
// each, so a test can use what one answer says in the next command.
class SecliSession {
 public:
  SecliSession(const std::string& root, const std::string& instance)
      : child_({SECLI_PATH, "--root", root, "--json", "--timeout", "10", "-i", instance, "-f", "-"},
               root) {}
  std::string call(const std::string& command) {
    child_.write(command + "\n");
    std::string line;
    if (!child_.out().nextLine(&pos_, &line)) return "(no answer; stderr: " + child_.err().text() + ")";
    return line;
  }
  Child& child() { return child_; }
  ~SecliSession() {
    child_.closeStdin();
    child_.err().waitEof();
    expectNoSanitizerReport("secli", child_.err().text());
  }

 private:
  Child child_;
  size_t pos_ = 0;
};

// The value of `name` in one flat JSON object, quotes removed.
std::string field(const std::string& json, const std::string& name) {
  const std::string key = "\"" + name + "\":";
  const size_t at = json.find(key);
  if (at == std::string::npos) return "(no " + name + " in " + json + ")";
  size_t begin = at + key.size();
  size_t end;
  if (begin < json.size() && json[begin] == '"') {
    ++begin;
    end = json.find('"', begin);
  } else {
    end = json.find_first_of(",}", begin);
  }
  if (end == std::string::npos) return "(bad " + name + " in " + json + ")";
  return json.substr(begin, end - begin);
}

std::string hexByte(int v) {
  char b[3];
  snprintf(b, sizeof(b), "%02X", v & 0xFF);
  return b;
}

class EseEndToEnd : public ::testing::Test {
 protected:
  void SetUp() override {
    // A child that dies early must not take the test with it on the next write.
    signal(SIGPIPE, SIG_IGN);
    char tmpl[] = "/tmp/ese_e2e.XXXXXX";
    ASSERT_NE(mkdtemp(tmpl), nullptr);
    root = tmpl;
  }
  void TearDown() override {
    if (daemon && HasFailure()) {
      fprintf(stderr, "---- daemon log ----\n%s---- end ----\n", daemon->err().text().c_str());
    }
    if (daemon) expectNoSanitizerReport("daemon", daemon->err().text());
    daemon.reset();
    const std::string rm = "rm -rf '" + root + "'";
    if (system(rm.c_str()) != 0) fprintf(stderr, "could not remove %s\n", root.c_str());
  }
  void setProperty(const std::string& line) {
    std::ofstream(root + "/properties", std::ios::app) << line << "\n";
  }
  // Starts the daemon and waits until it has registered "SIM1" (its last).
  void startDaemon() {
    daemon = std::make_unique<Child>(std::vector<std::string>{DAEMON_PATH}, root);
    ASSERT_TRUE(daemon->err().waitFor("ZerbSimSecureElement Registered sim1 success"))
        << daemon->err().text();
  }
  // Runs one secli command line to its end.
  int secli(const std::vector<std::string>& args, std::string* out) {
    std::vector<std::string> argv{SECLI_PATH, "--root", root};
    argv.insert(argv.end(), args.begin(), args.end());
    Child c(argv, root);
    c.closeStdin();
    const int rc = c.waitExit();
    *out = c.out().text();
    expectNoSanitizerReport("secli", c.err().text());
    return rc;
  }

  std::string root;
  std::unique_ptr<Child> daemon;
};

TEST_F(EseEndToEnd, ChannelsAndApdusThroughTheDaemon) {
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  SecliSession s(root, "eSE1");
  EXPECT_EQ(s.call("init"), R"({"cmd":"init","state":true})");
  EXPECT_EQ(field(s.call("present"), "present"), "true");
  EXPECT_EQ(field(s.call("atr"), "atr"), "");

  // Logical channel to the echo applet; an exchange on it; its close.
  std::string open = s.call(std::string("open ") + kEchoAid);
  EXPECT_EQ(field(open, "status"), "SUCCESS");
  const int echo = std::atoi(field(open, "channel").c_str());
  ASSERT_GE(echo, 1);
  ASSERT_LE(echo, 3);
  EXPECT_EQ(field(open, "select"), std::string("6F088406") + kEchoAid + "9000");
  EXPECT_EQ(field(s.call("transmit " + hexByte(echo) + " 01 00 00 03 AA BB CC"), "response"),
            "AABBCC9000");

  // An applet whose SELECT answers 61xx: the front fetches the FCI; then a
  // command left for GET RESPONSE, which the client sends itself.
  open = s.call(std::string("open ") + kBigAid);
  EXPECT_EQ(field(open, "status"), "SUCCESS");
  const int big = std::atoi(field(open, "channel").c_str());
  ASSERT_GE(big, 1);
  ASSERT_LE(big, 3);
  EXPECT_NE(big, echo);
  const std::string fci = field(open, "select");
  EXPECT_EQ(fci.substr(0, 2), "6F");
  EXPECT_EQ(fci.substr(fci.size() - 4), "9000");
  EXPECT_EQ(field(s.call("transmit " + hexByte(big) + " 11 00 10 00"), "response"), "6110");
  EXPECT_EQ(field(s.call("transmit " + hexByte(big) + " C0 00 00 10"), "response"),
            "000102030405060708090A0B0C0D0E0F9000");

  EXPECT_EQ(field(s.call("close " + std::to_string(echo)), "status"), "SUCCESS");
  EXPECT_EQ(field(s.call("close " + std::to_string(big)), "status"), "SUCCESS");

  // P2 7F reaches the card as 00 on a logical channel.
  open = s.call(std::string("open ") + kP2Aid + " 0x7F");
  EXPECT_EQ(field(open, "status"), "SUCCESS");
  const int p2 = std::atoi(field(open, "channel").c_str());
  EXPECT_EQ(field(s.call("transmit " + hexByte(p2) + " 20 00 00 00"), "response"), "009000");
  EXPECT_EQ(field(s.call("close " + std::to_string(p2)), "status"), "SUCCESS");

  // The basic channel; an exchange on it.
  const std::string basic = s.call(std::string("basic ") + kEchoAid);
  EXPECT_EQ(field(basic, "status"), "SUCCESS");
  EXPECT_EQ(field(basic, "select"), std::string("6F088406") + kEchoAid + "9000");
  EXPECT_EQ(field(s.call("transmit 00 01 00 00 02 12 34"), "response"), "12349000");

  // An applet the card does not have, on both channel kinds.
  open = s.call(std::string("open ") + kMissingAid);
  EXPECT_EQ(field(open, "status"), "NO_SUCH_ELEMENT_ERROR");
  EXPECT_EQ(field(open, "select"), "6A82");
  EXPECT_EQ(field(s.call(std::string("basic ") + kMissingAid), "status"), "NO_SUCH_ELEMENT_ERROR");

  s.child().closeStdin();
  EXPECT_EQ(s.child().waitExit(), 0);
}

TEST_F(EseEndToEnd, AKilledClientClosesTheEseAndTheNextInitOpensItAgain) {
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  size_t mark = 0;
  {
    SecliSession first(root, "eSE1");
    ASSERT_EQ(field(first.call("init"), "state"), "true");
    ASSERT_EQ(field(first.call(std::string("open ") + kEchoAid), "status"), "SUCCESS");
    mark = daemon->err().text().size();
    first.child().killNow();
  }
  EXPECT_TRUE(daemon->err().waitFor("serviceDied enter!", mark));
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_close", mark));

  mark = daemon->err().text().size();
  SecliSession second(root, "eSE1");
  EXPECT_EQ(field(second.call("init"), "state"), "true");
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_init_open: open", mark));
  // The eSE serves again.
  const std::string open = second.call(std::string("open ") + kEchoAid);
  EXPECT_EQ(field(open, "status"), "SUCCESS");
  const int ch = std::atoi(field(open, "channel").c_str());
  EXPECT_EQ(field(second.call("transmit " + hexByte(ch) + " 01 00 00 01 5A"), "response"), "5A9000");
}

TEST_F(EseEndToEnd, WithoutAnEseOnlySim1IsServed) {
  setProperty("vendor.ese_sim.type=0");
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  EXPECT_TRUE(daemon->err().waitFor("g_ese_type = 0!"));
  std::string out;
  EXPECT_EQ(secli({"list"}, &out), 0);
  EXPECT_NE(out.find("SIM1"), std::string::npos) << out;
  EXPECT_EQ(out.find("eSE1"), std::string::npos) << out;
  EXPECT_EQ(daemon->err().text().find("eSE1"), std::string::npos);
  EXPECT_EQ(secli({"-i", "eSE1", "present"}, &out), 1);
}

TEST_F(EseEndToEnd, WithAnEseBothInstancesAreServed) {
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  std::string out;
  EXPECT_EQ(secli({"list"}, &out), 0);
  EXPECT_NE(out.find("eSE1"), std::string::npos) << out;
  EXPECT_NE(out.find("SIM1"), std::string::npos) << out;
  // eSE1 was registered before SIM1.
  const std::string log = daemon->err().text();
  EXPECT_LT(log.find("SecureElement Registered eSE1 success"),
            log.find("ZerbSimSecureElement Registered sim1 success"));
}

}  // namespace

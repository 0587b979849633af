#include "se_harness.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <stdexcept>

namespace se_test {

const char* const kDaemon = SE_DAEMON_PATH;
const char* const kSecli = SE_SECLI_PATH;
const char* const kModemSim = SE_MODEM_SIM_PATH;

namespace fs = std::filesystem;

TempRoot::TempRoot(size_t length) {
  // A child that dies early must not take the test with it on the next write.
  signal(SIGPIPE, SIG_IGN);
  char tmpl[] = "/tmp/se_e2e.XXXXXX";
  if (mkdtemp(tmpl) == nullptr) throw std::runtime_error("mkdtemp");
  top_ = path_ = tmpl;
  while (path_.size() < length) {
    const size_t part = std::min<size_t>(60, std::max<size_t>(1, length - path_.size() - 1));
    path_ += "/" + std::string(part, 'd');
  }
  if (path_ != top_) fs::create_directories(path_);
}

TempRoot::~TempRoot() {
  std::error_code ec;
  fs::remove_all(top_, ec);
}

static void put(const std::string& path, const std::string& content, std::ios::openmode mode) {
  fs::create_directories(fs::path(path).parent_path());
  std::ofstream(path, mode) << content;
}

void TempRoot::write(const std::string& rel, const std::string& content) const {
  put(at(rel), content, std::ios::trunc);
}

void TempRoot::append(const std::string& rel, const std::string& content) const {
  put(at(rel), content, std::ios::app);
}

Output::Output(int fd) : fd_(fd), thread_([this] { run(); }) {}

Output::~Output() {
  thread_.join();
  close(fd_);
}

std::string Output::text() {
  std::lock_guard<std::mutex> l(mu_);
  return text_;
}

size_t Output::size() {
  std::lock_guard<std::mutex> l(mu_);
  return text_.size();
}

bool Output::waitFor(const std::string& needle, size_t from, int ms) {
  std::unique_lock<std::mutex> l(mu_);
  return cv_.wait_for(l, std::chrono::milliseconds(ms), [&] {
    return text_.size() >= from && text_.find(needle, from) != std::string::npos;
  });
}

bool Output::nextLine(size_t* pos, std::string* line, int ms) {
  std::unique_lock<std::mutex> l(mu_);
  // A child that has ended gives no more lines.
  cv_.wait_for(l, std::chrono::milliseconds(ms),
               [&] { return eof_ || text_.find('\n', *pos) != std::string::npos; });
  const size_t nl = text_.find('\n', *pos);
  if (nl == std::string::npos) return false;
  *line = text_.substr(*pos, nl - *pos);
  *pos = nl + 1;
  return true;
}

bool Output::waitEof(int ms) {
  std::unique_lock<std::mutex> l(mu_);
  return cv_.wait_for(l, std::chrono::milliseconds(ms), [&] { return eof_; });
}

void Output::run() {
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

Process::Process(const std::vector<std::string>& argv, const std::string& root) {
  int in[2], out[2], err[2];
  if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) {
    throw std::runtime_error("pipe");
  }
  // Everything exec needs is built before fork: the child of a threaded
  // process may only make async-signal-safe calls.
  std::vector<std::string> envText;
  for (char** e = environ; *e; ++e) {
    if (strncmp(*e, "SE_DEVICE_ROOT=", 15) != 0) envText.emplace_back(*e);
  }
  envText.push_back("SE_DEVICE_ROOT=" + root);
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
  out_ = std::make_unique<Output>(out[0]);
  err_ = std::make_unique<Output>(err[0]);
}

Process::~Process() {
  closeStdin();
  if (!reaped_) {
    kill(pid_, SIGKILL);
    waitpid(pid_, &status_, 0);
  }
  out_.reset();
  err_.reset();
}

void Process::write(const std::string& text) {
  const char* p = text.data();
  size_t left = text.size();
  while (left > 0 && stdin_ >= 0) {
    const ssize_t n = ::write(stdin_, p, left);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;
    p += n;
    left -= static_cast<size_t>(n);
  }
}

void Process::closeStdin() {
  if (stdin_ >= 0) close(stdin_);
  stdin_ = -1;
}

void Process::stop(int sig) {
  if (reaped_) return;
  kill(pid_, sig);
  waitpid(pid_, &status_, 0);
  reaped_ = true;
  out_->waitEof();
  err_->waitEof();
}

int Process::waitExit(int ms) {
  if (!reaped_) {
    if (!out_->waitEof(ms) || !err_->waitEof(ms)) return -1;
    if (waitpid(pid_, &status_, 0) != pid_) return -1;
    reaped_ = true;
  }
  return WIFEXITED(status_) ? WEXITSTATUS(status_) : 128 + WTERMSIG(status_);
}

bool Process::running() {
  if (reaped_) return false;
  if (waitpid(pid_, &status_, WNOHANG) == 0) return true;
  reaped_ = true;
  return false;
}

std::unique_ptr<Process> startDaemon(const TempRoot& root) {
  auto d = std::make_unique<Process>(std::vector<std::string>{kDaemon}, root.path());
  EXPECT_TRUE(d->err().waitFor(
      "AIDL Registered android.hardware.secure_element.ISecureElement/SIM1 success"))
      << d->err().text();
  return d;
}

std::unique_ptr<Process> startModem(const TempRoot& root, int modem,
                                    const std::vector<std::string>& extra) {
  std::vector<std::string> argv{kModemSim, "--root", root.path(), "--modem", std::to_string(modem)};
  argv.insert(argv.end(), extra.begin(), extra.end());
  auto m = std::make_unique<Process>(argv, root.path());
  EXPECT_TRUE(m->out().waitFor("ready")) << m->out().text() << m->err().text();
  return m;
}

SecliSession::SecliSession(const TempRoot& root, const std::string& instance,
                           const std::vector<std::string>& extra)
    : proc_(
          [&] {
            std::vector<std::string> argv{kSecli, "--root", root.path(), "--json", "--timeout", "20",
                                          "-i", instance};
            argv.insert(argv.end(), extra.begin(), extra.end());
            argv.insert(argv.end(), {"-f", "-"});
            return argv;
          }(),
          root.path()) {}

SecliSession::~SecliSession() {
  proc_.closeStdin();
  proc_.err().waitEof();
  expectNoSanitizerReport("secli", proc_.err().text());
}

void SecliSession::send(const std::string& command) { proc_.write(command + "\n"); }

bool SecliSession::answer(std::string* line, int ms) { return proc_.out().nextLine(&pos_, line, ms); }

std::string SecliSession::call(const std::string& command, int ms) {
  send(command);
  std::string line;
  if (!answer(&line, ms)) return "(no answer to " + command + "; stderr: " + proc_.err().text() + ")";
  return line;
}

int secli(const TempRoot& root, const std::vector<std::string>& args, std::string* out,
          std::string* err) {
  std::vector<std::string> argv{kSecli, "--root", root.path()};
  argv.insert(argv.end(), args.begin(), args.end());
  Process p(argv, root.path());
  p.closeStdin();
  const int rc = p.waitExit();
  *out = p.out().text();
  if (err) *err = p.err().text();
  expectNoSanitizerReport("secli", p.err().text());
  return rc;
}

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
  const char* digits = "0123456789ABCDEF";
  return {digits[(v >> 4) & 0xF], digits[v & 0xF]};
}

size_t countOf(const std::string& text, const std::string& needle) {
  size_t n = 0;
  for (size_t pos = text.find(needle); pos != std::string::npos; pos = text.find(needle, pos + 1)) {
    ++n;
  }
  return n;
}

System::~System() {
  if (daemon) {
    daemon->stop(SIGKILL);
    expectNoSanitizerReport("daemon", daemon->err().text());
  }
  if (!::testing::Test::HasFailure()) return;
  if (daemon) fprintf(stderr, "---- daemon ----\n%s", daemon->err().text().c_str());
  if (modem) fprintf(stderr, "---- modem ----\n%s", modem->err().text().c_str());
}

int openEcho(SecliSession& s) {
  const std::string open = s.call(std::string("open ") + kEchoApplet);
  EXPECT_EQ(field(open, "status"), "SUCCESS") << open;
  return field(open, "status") == "SUCCESS" ? atoi(field(open, "channel").c_str()) : -1;
}

std::string echoCommand(int channel, const std::string& byte) {
  return "transmit " + hexByte(channel) + " 01 00 00 01 " + byte;
}

std::string echo(SecliSession& s, int channel, const std::string& byte) {
  return field(s.call(echoCommand(channel, byte)), "response");
}

long msSince(std::chrono::steady_clock::time_point t0) {
  return static_cast<long>(std::chrono::duration_cast<std::chrono::milliseconds>(
                               std::chrono::steady_clock::now() - t0)
                               .count());
}

void expectNoSanitizerReport(const std::string& who, const std::string& text) {
  for (const char* mark : {"ERROR: AddressSanitizer", "ERROR: LeakSanitizer",
                           "WARNING: ThreadSanitizer", "runtime error:"}) {
    EXPECT_EQ(text.find(mark), std::string::npos) << who << ":\n" << text;
  }
}

}  // namespace se_test

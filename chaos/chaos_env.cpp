#include "chaos_env.h"

#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <sstream>

#include "chaos_record.h"

namespace chaos {

bool Proc::start(const std::vector<std::string>& argv, const std::vector<std::string>& env, int outFd,
                 const std::string& errPath, int extraFd) {
  std::vector<char*> args;
  for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
  args.push_back(nullptr);
  const pid_t parent = getpid();
  pid_ = fork();
  if (pid_ < 0) return false;
  if (pid_ == 0) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (getppid() != parent) _exit(127);
    // Its own process group: a terminal's Ctrl-C reaches the soak, which
    // stops everything in order.
    setpgid(0, 0);
    const int devNull = ::open("/dev/null", O_RDWR);
    const int err = ::open(errPath.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    dup2(devNull, 0);
    dup2(outFd >= 0 ? outFd : devNull, 1);
    dup2(err >= 0 ? err : devNull, 2);
    if (extraFd >= 0) {
      if (extraFd != 3) {
        dup2(extraFd, 3);
      } else {
        fcntl(3, F_SETFD, 0);
      }
    }
    for (const std::string& e : env) putenv(const_cast<char*>(e.c_str()));
    signal(SIGINT, SIG_DFL);
    signal(SIGTERM, SIG_DFL);
    signal(SIGPIPE, SIG_DFL);
    execv(args[0], args.data());
    _exit(127);
  }
  return true;
}

void Proc::kill(int sig) {
  if (pid_ > 0) ::kill(pid_, sig);
}

bool Proc::running(int* status) {
  if (pid_ <= 0) return false;
  int st = 0;
  const pid_t r = waitpid(pid_, &st, WNOHANG);
  if (r == 0) return true;
  if (status) *status = st;
  pid_ = -1;
  return false;
}

void Proc::stop(int graceMs) {
  if (pid_ <= 0) return;
  ::kill(pid_, SIGTERM);
  const int64_t deadline = monoNanos() + int64_t(graceMs) * 1000000;
  while (monoNanos() < deadline) {
    if (waitpid(pid_, nullptr, WNOHANG) == pid_) {
      pid_ = -1;
      return;
    }
    struct timespec ts = {0, 10 * 1000000};
    nanosleep(&ts, nullptr);
  }
  ::kill(pid_, SIGKILL);
  waitpid(pid_, nullptr, 0);
  pid_ = -1;
}

void Properties::set(const std::string& name, const std::string& value) { values_[name] = value; }
void Properties::clear(const std::string& name) { values_.erase(name); }

bool Properties::write() const {
  std::string text;
  for (const auto& [k, v] : values_) text += k + "=" + v + "\n";
  const std::string tmp = path_ + ".tmp";
  return writeFile(tmp, text) && rename(tmp.c_str(), path_.c_str()) == 0;
}

Health healthOf(pid_t pid) {
  Health h;
  const std::string base = "/proc/" + std::to_string(pid);
  std::ifstream status(base + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmRSS:", 0) == 0) h.rssKb = strtol(line.c_str() + 6, nullptr, 10);
    if (line.rfind("Threads:", 0) == 0) h.threads = strtol(line.c_str() + 8, nullptr, 10);
  }
  if (DIR* d = opendir((base + "/fd").c_str())) {
    long n = 0;
    while (dirent* e = readdir(d)) {
      if (e->d_name[0] != '.') ++n;
    }
    closedir(d);
    h.fds = n;
  }
  if (DIR* d = opendir((base + "/task").c_str())) {
    while (dirent* e = readdir(d)) {
      if (e->d_name[0] != '.') h.tids.push_back(strtol(e->d_name, nullptr, 10));
    }
    closedir(d);
  }
  return h;
}

int openChannelsIn(const std::string& path) {
  std::vector<int> channels;
  return channelListIn(path, &channels) ? static_cast<int>(channels.size()) : -1;
}

bool channelListIn(const std::string& path, std::vector<int>* channels) {
  channels->clear();
  std::ifstream in(path);
  if (!in) return false;
  std::string line;
  std::getline(in, line);
  std::istringstream words(line);
  std::string w;
  while (words >> w) channels->push_back(atoi(w.c_str()));
  return true;
}

bool writeFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::trunc);
  out << text;
  return static_cast<bool>(out);
}

std::string readLine(int fd, int timeoutMs) {
  std::string line;
  const int64_t deadline = monoNanos() + int64_t(timeoutMs) * 1000000;
  for (;;) {
    const int left = static_cast<int>((deadline - monoNanos()) / 1000000);
    if (left <= 0) return "";
    pollfd p{fd, POLLIN, 0};
    if (poll(&p, 1, left) <= 0) continue;
    char c;
    if (read(fd, &c, 1) != 1) return "";
    if (c == '\n') return line;
    line.push_back(c);
  }
}

std::string makeTempDir(const char* prefix) {
  std::string tmpl = std::string("/tmp/") + prefix + ".XXXXXX";
  std::vector<char> buf(tmpl.begin(), tmpl.end());
  buf.push_back('\0');
  if (mkdtemp(buf.data()) == nullptr) return "";
  return buf.data();
}

}  // namespace chaos

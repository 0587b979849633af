#pragma once
// A scripted modem on the far end of an AT port, shared by the channel tests
// and the SIM engine tests. A thread reads what is written to the port,
// records each command (ended by CR) and hands it to the test's script, which
// answers with send(). The port is one end of a socket pair or the slave of a
// raw pty; a pty's slave can also be reached through a link in a device root.
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <pty.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <termios.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace at_test {

constexpr std::chrono::milliseconds kGenerous(20000);

// Polls a condition that has no event of its own (log records, flags set by
// another thread) until a generous deadline.
template <typename Pred>
bool eventually(Pred pred, std::chrono::milliseconds limit = kGenerous) {
  const auto end = std::chrono::steady_clock::now() + limit;
  while (!pred()) {
    if (std::chrono::steady_clock::now() > end) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

class ScriptedModem {
 public:
  // Runs on the modem thread, outside the modem's lock; may block or send.
  using Script = std::function<void(ScriptedModem&, const std::string&)>;

  // The port end is handed to the code under test, which closes it.
  static std::unique_ptr<ScriptedModem> socketPair() {
    int sv[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv) != 0) return nullptr;
    return std::unique_ptr<ScriptedModem>(new ScriptedModem(sv[1], sv[0], ""));
  }
  // Without `linkPath` the slave is handed over like a socket pair's end.
  // With it, the modem keeps the slave open and links its name there, now
  // or at link(), for the code under test to open by path.
  static std::unique_ptr<ScriptedModem> pty(const std::string& linkPath = "", bool linkNow = true) {
    // openpty, not open() of the slave's name: tests may map the program's
    // own opens of absolute paths into a device root.
    int master = -1, slave = -1;
    char name[256] = {0};
    if (openpty(&master, &slave, name, nullptr, nullptr) != 0) return nullptr;
    fcntl(master, F_SETFD, FD_CLOEXEC);
    fcntl(slave, F_SETFD, FD_CLOEXEC);
    struct termios t;
    tcgetattr(slave, &t);
    cfmakeraw(&t);
    tcsetattr(slave, TCSANOW, &t);
    std::unique_ptr<ScriptedModem> m(new ScriptedModem(master, slave, linkPath));
    m->slaveName_ = name;
    if (!linkPath.empty() && linkNow) m->link();
    return m;
  }

  ~ScriptedModem() {
    (void)!write(stop_[1], "x", 1);
    if (thread_.joinable()) thread_.join();
    if (!linkPath_.empty()) {
      unlink(linkPath_.c_str());
      close(port_);
    }
    for (int fd : {fd_, stop_[0], stop_[1]}) close(fd);
  }
  ScriptedModem(const ScriptedModem&) = delete;
  ScriptedModem& operator=(const ScriptedModem&) = delete;

  int portFd() const { return port_; }
  void link() { (void)symlink(slaveName_.c_str(), linkPath_.c_str()); }
  // Until a script is set, commands are recorded and not answered.
  void setScript(Script script) {
    std::lock_guard<std::mutex> g(m_);
    script_ = std::move(script);
  }
  void send(const std::string& bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
      ssize_t n = write(fd_, bytes.data() + done, bytes.size() - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return;
      done += static_cast<size_t>(n);
    }
  }
  void shutdownWrite() { shutdown(fd_, SHUT_WR); }

  std::vector<std::string> commands() {
    std::lock_guard<std::mutex> g(m_);
    return commands_;
  }
  void clearCommands() {
    std::lock_guard<std::mutex> g(m_);
    commands_.clear();
  }
  // True once the far end has been closed.
  bool waitHangup(std::chrono::milliseconds limit = kGenerous) {
    std::unique_lock<std::mutex> g(m_);
    return cv_.wait_for(g, limit, [&] { return hungUp_; });
  }

 private:
  ScriptedModem(int fd, int port, std::string linkPath)
      : fd_(fd), port_(port), linkPath_(std::move(linkPath)) {
    if (pipe2(stop_, O_CLOEXEC) != 0) abort();
    thread_ = std::thread([this] { run(); });
  }

  void run() {
    std::string pending;
    for (;;) {
      struct pollfd pfd[2] = {{fd_, POLLIN, 0}, {stop_[0], POLLIN, 0}};
      if (poll(pfd, 2, -1) < 0) {
        if (errno == EINTR) continue;
        return;
      }
      if (pfd[1].revents != 0) return;
      char buf[4096];
      ssize_t n = read(fd_, buf, sizeof(buf));
      if (n <= 0) {
        {
          std::lock_guard<std::mutex> g(m_);
          hungUp_ = true;
        }
        cv_.notify_all();
        struct pollfd s = {stop_[0], POLLIN, 0};
        poll(&s, 1, -1);
        return;
      }
      pending.append(buf, static_cast<size_t>(n));
      size_t cr;
      while ((cr = pending.find('\r')) != std::string::npos) {
        std::string cmd = pending.substr(0, cr);
        pending.erase(0, cr + 1);
        while (!cmd.empty() && cmd[0] == '\n') cmd.erase(0, 1);
        if (cmd.empty()) continue;
        // Recorded before the answer, so a caller that has its result also
        // finds the command here.
        Script script;
        {
          std::lock_guard<std::mutex> g(m_);
          commands_.push_back(cmd);
          script = script_;
        }
        cv_.notify_all();
        if (script) script(*this, cmd);
      }
    }
  }

  int fd_;
  int port_;
  std::string linkPath_;
  std::string slaveName_;
  int stop_[2] = {-1, -1};
  std::thread thread_;
  std::mutex m_;
  std::condition_variable cv_;
  Script script_;
  std::vector<std::string> commands_;
  bool hungUp_ = false;
};

}  // namespace at_test

#pragma once
// A scripted modem behind a pty: the test links DIR/dev/appvcomNN to the
// slave, a thread reads the commands the daemon writes on the master (each
// ended by CR) and writes back whatever the script answers.
#include <fcntl.h>
#include <poll.h>
#include <pty.h>
#include <termios.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace sim_test {

// Answer forms of the modem.
inline std::string okLine(const std::string& line) { return "\r\n" + line + "\r\n\r\nOK\r\n"; }
inline std::string finalLine(const std::string& text) { return "\r\n" + text + "\r\n"; }

class FakeModem {
 public:
  using Script = std::function<std::string(const std::string& command)>;

  // `linkPath` is the absolute host path of the device link; with
  // linkNow false the link is made later by link().
  explicit FakeModem(std::string linkPath, bool linkNow = true) : linkPath_(std::move(linkPath)) {
    char name[256] = {0};
    if (openpty(&master_, &slave_, name, nullptr, nullptr) != 0) return;
    slaveName_ = name;
    struct termios tio;
    tcgetattr(slave_, &tio);
    cfmakeraw(&tio);
    tcsetattr(slave_, TCSANOW, &tio);
    if (pipe(stopPipe_) != 0) return;
    if (linkNow) link();
    thread_ = std::thread([this] { run(); });
  }
  ~FakeModem() {
    if (thread_.joinable()) {
      char c = 'x';
      ssize_t w = write(stopPipe_[1], &c, 1);
      (void)w;
      thread_.join();
    }
    unlink(linkPath_.c_str());
    for (int fd : {master_, slave_, stopPipe_[0], stopPipe_[1]}) {
      if (fd >= 0) close(fd);
    }
  }
  FakeModem(const FakeModem&) = delete;
  FakeModem& operator=(const FakeModem&) = delete;

  bool ok() const { return master_ >= 0 && !slaveName_.empty(); }
  void link() { (void)symlink(slaveName_.c_str(), linkPath_.c_str()); }

  void setScript(Script script) {
    std::lock_guard<std::mutex> lock(mu_);
    script_ = std::move(script);
  }
  std::vector<std::string> commands() const {
    std::lock_guard<std::mutex> lock(mu_);
    return commands_;
  }
  void clearCommands() {
    std::lock_guard<std::mutex> lock(mu_);
    commands_.clear();
  }
  bool received(const std::string& command) const {
    for (const std::string& c : commands()) {
      if (c == command) return true;
    }
    return false;
  }
  // Waits until at least `count` commands have arrived.
  bool waitForCommands(size_t count, int timeoutMs = 20000) {
    std::unique_lock<std::mutex> lock(mu_);
    return cv_.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                        [&] { return commands_.size() >= count; });
  }

 private:
  void run() {
    std::string pending;
    for (;;) {
      struct pollfd fds[2] = {{master_, POLLIN, 0}, {stopPipe_[0], POLLIN, 0}};
      if (poll(fds, 2, -1) < 0) continue;
      if (fds[1].revents) return;
      if (!(fds[0].revents & POLLIN)) continue;
      char buf[1024];
      ssize_t n = read(master_, buf, sizeof(buf));
      if (n <= 0) continue;
      pending.append(buf, static_cast<size_t>(n));
      size_t cr;
      while ((cr = pending.find('\r')) != std::string::npos) {
        std::string command = pending.substr(0, cr);
        pending.erase(0, cr + 1);
        while (!command.empty() && command[0] == '\n') command.erase(0, 1);
        if (command.empty()) continue;
        // Recorded before the answer, so a caller that has its result also
        // finds the command here.
        std::string reply;
        {
          std::lock_guard<std::mutex> lock(mu_);
          commands_.push_back(command);
          reply = script_ ? script_(command) : finalLine("ERROR");
        }
        cv_.notify_all();
        writeAll(reply);
      }
    }
  }
  void writeAll(const std::string& s) {
    size_t off = 0;
    while (off < s.size()) {
      ssize_t w = write(master_, s.data() + off, s.size() - off);
      if (w <= 0) return;
      off += static_cast<size_t>(w);
    }
  }

  std::string linkPath_;
  std::string slaveName_;
  int master_ = -1;
  int slave_ = -1;
  int stopPipe_[2] = {-1, -1};
  mutable std::mutex mu_;
  std::condition_variable cv_;
  Script script_;
  std::vector<std::string> commands_;
  std::thread thread_;
};

// Polls a condition set by another thread that offers no event to wait on,
// with a generous deadline.
template <typename Pred>
bool waitUntil(Pred pred, int timeoutMs = 20000) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  while (!pred()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    poll(nullptr, 0, 1);
  }
  return true;
}

}  // namespace sim_test

#include "chaos_relay.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <termios.h>
#include <unistd.h>

#include <algorithm>

#include "chaos_record.h"

namespace chaos {

namespace {


bool isFinal(const std::string& l) {
  return l == "OK" || l == "ERROR" || l == "NO CARRIER" || l.rfind("+CME ERROR", 0) == 0 ||
         l.rfind("+CMS ERROR", 0) == 0;
}

void closeFd(int& fd) {
  if (fd >= 0) close(fd);
  fd = -1;
}

}  // namespace

bool ModemRelay::start(const std::string& link, const std::string& modemPort, std::string* error) {
  link_ = link;
  if (pipe2(wakePipe_, O_CLOEXEC | O_NONBLOCK) != 0) {
    *error = std::string("pipe: ") + strerror(errno);
    return false;
  }
  {
    std::lock_guard<std::mutex> l(mu_);
    if (!openPty(error)) return false;
  }
  if (!reconnectModem(modemPort, error)) return false;
  thread_ = std::thread([this] { run(); });
  return true;
}

void ModemRelay::stop() {
  if (thread_.joinable()) {
    stop_ = true;
    wake();
    thread_.join();
  }
  std::lock_guard<std::mutex> l(mu_);
  closePty();
  closeFd(modem_);
  closeFd(wakePipe_[0]);
  closeFd(wakePipe_[1]);
}

void ModemRelay::wake() {
  const char b = 1;
  ssize_t ignored = write(wakePipe_[1], &b, 1);
  (void)ignored;
}

bool ModemRelay::openPty(std::string* error) {
  master_ = posix_openpt(O_RDWR | O_NOCTTY | O_NONBLOCK | O_CLOEXEC);
  char name[128];
  if (master_ < 0 || grantpt(master_) != 0 || unlockpt(master_) != 0 || ptsname_r(master_, name, sizeof(name)) != 0) {
    *error = std::string("pty: ") + strerror(errno);
    closeFd(master_);
    return false;
  }
  slave_ = ::open(name, O_RDWR | O_NOCTTY | O_CLOEXEC);
  termios t;
  if (slave_ < 0 || tcgetattr(slave_, &t) != 0) {
    *error = std::string("pty slave: ") + strerror(errno);
    closePty();
    return false;
  }
  cfmakeraw(&t);
  tcsetattr(slave_, TCSANOW, &t);
  // Moved into place in one step: the daemon never finds the link missing
  // or half made while the port is meant to be there.
  const std::string tmp = link_ + ".new";
  unlink(tmp.c_str());
  if (symlink(name, tmp.c_str()) != 0 || rename(tmp.c_str(), link_.c_str()) != 0) {
    *error = "link " + link_ + ": " + strerror(errno);
    closePty();
    return false;
  }
  return true;
}

void ModemRelay::closePty() {
  if (master_ >= 0) unlink(link_.c_str());
  closeFd(slave_);
  closeFd(master_);
}

void ModemRelay::setSilent(bool on) {
  std::lock_guard<std::mutex> l(mu_);
  silent_ = on;
  wake();
}
void ModemRelay::setSlowMs(int ms) {
  std::lock_guard<std::mutex> l(mu_);
  slowMs_ = ms;
}
void ModemRelay::setPieceBytes(int n) {
  std::lock_guard<std::mutex> l(mu_);
  pieces_ = n;
}
void ModemRelay::setUnsolLines(int n) {
  std::lock_guard<std::mutex> l(mu_);
  unsol_ = n;
}
void ModemRelay::setBare(bool on) {
  std::lock_guard<std::mutex> l(mu_);
  bare_ = on;
}

void ModemRelay::losePort() {
  std::unique_lock<std::mutex> l(mu_);
  if (master_ < 0) return;
  losing_ = true;
  lost_ = false;
  loseDeadline_ = monoNanos() + 2000 * kMs;
  // A command cut off in the middle would run into the next one: finish it
  // (the modem answers ERROR, which goes back before the port does).
  if (lineOpen_ && modem_ >= 0) {
    ssize_t ignored = write(modem_, "\r", 1);
    (void)ignored;
    lineOpen_ = false;
    ++pending_;
  }
  wake();
  cv_.wait(l, [&] { return lost_ || stop_; });
}

bool ModemRelay::restorePort(std::string* error) {
  std::lock_guard<std::mutex> l(mu_);
  if (master_ >= 0) return true;
  out_.clear();
  pending_ = 0;
  answering_ = lineOpen_ = false;
  const bool ok = openPty(error);
  lost_ = !ok;
  wake();
  return ok;
}

bool ModemRelay::reconnectModem(const std::string& modemPort, std::string* error) {
  std::lock_guard<std::mutex> l(mu_);
  closeFd(modem_);
  fromModem_.clear();
  pending_ = 0;
  answering_ = false;
  modem_ = ::open(modemPort.c_str(), O_RDWR | O_NOCTTY | O_NONBLOCK | O_CLOEXEC);
  if (modem_ < 0) {
    *error = "open " + modemPort + ": " + strerror(errno);
    return false;
  }
  wake();
  return true;
}

void ModemRelay::run() {
  char drain[64];
  while (!stop_) {
    pollfd fds[3] = {{wakePipe_[0], POLLIN, 0}, {-1, POLLIN, 0}, {-1, POLLIN, 0}};
    int timeout = -1;
    {
      std::lock_guard<std::mutex> l(mu_);
      if (master_ >= 0 && !silent_ && !losing_) fds[1].fd = master_;
      fds[2].fd = modem_;
      if (master_ >= 0 && !silent_ && !out_.empty()) {
        const int64_t left = out_.front().notBefore - monoNanos();
        timeout = left <= 0 ? 0 : static_cast<int>((left + kMs - 1) / kMs);
      }
      if (losing_) timeout = timeout < 0 ? 20 : std::min(timeout, 20);
      if (writeBlocked_) timeout = 5;  // the daemon is not reading: try again soon
    }
    if (poll(fds, 3, timeout) < 0 && errno != EINTR) return;
    if (fds[0].revents) {
      while (read(wakePipe_[0], drain, sizeof(drain)) > 0) {
      }
    }
    std::unique_lock<std::mutex> l(mu_);
    if (fds[1].revents && fds[1].fd == master_) fromDaemon();
    if (fds[2].revents && fds[2].fd == modem_) fromModem();
    if (master_ >= 0 && !silent_) flushDue();
    if (losing_ && ((pending_ == 0 && out_.empty()) || monoNanos() > loseDeadline_)) {
      // Let the daemon read what was written, then hang up.
      for (int i = 0; i < 100 && slave_ >= 0; ++i) {
        int queued = 0;
        if (ioctl(slave_, FIONREAD, &queued) != 0 || (queued == 0 && i >= 10)) break;
        l.unlock();
        usleep(5000);
        l.lock();
      }
      closePty();
      out_.clear();
      losing_ = false;
      lost_ = true;
      cv_.notify_all();
    }
  }
  std::lock_guard<std::mutex> l(mu_);
  cv_.notify_all();
}

void ModemRelay::fromDaemon() {
  char buf[4096];
  const ssize_t n = read(master_, buf, sizeof(buf));
  if (n <= 0) return;  // the daemon has the port closed; our slave keeps it alive
  if (modem_ >= 0) {
    size_t off = 0;
    while (off < static_cast<size_t>(n)) {
      ssize_t w = write(modem_, buf + off, static_cast<size_t>(n) - off);
      if (w < 0 && errno == EAGAIN) {
        usleep(1000);
        continue;
      }
      if (w <= 0) break;
      off += static_cast<size_t>(w);
    }
  }
  for (ssize_t i = 0; i < n; ++i) {
    if (buf[i] == '\r') {
      ++pending_;
      ++commands_;
      if (modem_ < 0) ++dropped_;
    }
  }
  lineOpen_ = buf[n - 1] != '\r' && buf[n - 1] != '\n';
}

void ModemRelay::fromModem() {
  char buf[4096];
  const ssize_t n = read(modem_, buf, sizeof(buf));
  if (n < 0 && errno == EAGAIN) return;
  if (n <= 0) {
    // modem-sim is gone; the run reconnects once a new one is up.
    closeFd(modem_);
    pending_ = 0;
    return;
  }
  fromModem_.append(buf, static_cast<size_t>(n));
  size_t nl;
  while ((nl = fromModem_.find('\n')) != std::string::npos) {
    std::string line = fromModem_.substr(0, nl);
    fromModem_.erase(0, nl + 1);
    if (!line.empty() && line.back() == '\r') line.pop_back();
    if (!line.empty()) queueLine(std::move(line));
  }
}

void ModemRelay::queueLine(std::string line) {
  const bool final = isFinal(line);
  if (bare_ && (line.rfind("+CCHO: ", 0) == 0 || line.rfind("+CCHP: ", 0) == 0)) line.erase(0, 7);
  int64_t at = monoNanos();
  if (!out_.empty()) at = std::max(at, out_.back().notBefore);
  if (!answering_ && slowMs_ > 0) at += slowMs_ * kMs;
  answering_ = true;
  auto push = [&](const std::string& text) {
    const std::string bytes = text + "\r\n";
    const size_t piece = pieces_ > 0 ? static_cast<size_t>(pieces_) : bytes.size();
    for (size_t off = 0; off < bytes.size(); off += piece) {
      out_.push_back({bytes.substr(off, piece), at});
      if (pieces_ > 0) at += kMs;
    }
  };
  if (final) {
    static const char* const kUnsol[] = {"+CREG: 1", "^RSSI: 20", "RING"};
    for (int i = 0; i < unsol_; ++i) push(kUnsol[unsolTurn_++ % 3]);
  }
  push(line);
  if (final) {
    answering_ = false;
    pending_ = std::max(0, pending_ - 1);
  }
}

void ModemRelay::flushDue() {
  const int64_t now = monoNanos();
  writeBlocked_ = false;
  while (!out_.empty() && out_.front().notBefore <= now) {
    Chunk& c = out_.front();
    const ssize_t w = write(master_, c.bytes.data(), c.bytes.size());
    if (w < 0) {
      if (errno == EAGAIN) {
        writeBlocked_ = true;
      } else {
        out_.clear();  // nobody on the other side for now
      }
      return;
    }
    if (static_cast<size_t>(w) < c.bytes.size()) {
      c.bytes.erase(0, static_cast<size_t>(w));
      return;
    }
    out_.pop_front();
  }
}

}  // namespace chaos

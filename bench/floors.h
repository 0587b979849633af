#pragma once
// The transport floors of the benchmark: what a round trip between two
// processes costs over a Unix stream socket and over a pty, with nothing
// around it. Each floor is a forked echo process that answers every request
// with a prepared answer of the size the real exchange has, using blocking
// read() and write() only; the benchmark side does the same. So the floors
// are the kernel's part of a call (two wake-ups, the copies) and nothing of
// the daemon's.
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <termios.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <string>
#include <vector>

namespace se_bench {

// One request and the answer the echo process sends back for it. Requests
// of one floor must differ in length: the echo process tells them apart by
// their length (socket) or their text up to CR (pty).
struct Exchange {
  std::vector<uint8_t> request;
  std::vector<uint8_t> answer;
};

namespace floors_detail {

inline bool writeFully(int fd, const uint8_t* p, size_t n) {
  while (n > 0) {
    ssize_t w = ::write(fd, p, n);
    if (w < 0 && errno == EINTR) continue;
    if (w <= 0) return false;
    p += w;
    n -= static_cast<size_t>(w);
  }
  return true;
}

inline bool readFully(int fd, uint8_t* p, size_t n) {
  while (n > 0) {
    ssize_t r = ::read(fd, p, n);
    if (r < 0 && errno == EINTR) continue;
    if (r <= 0) return false;
    p += r;
    n -= static_cast<size_t>(r);
  }
  return true;
}

}  // namespace floors_detail

// The echo process and the benchmark's end of its channel. The child runs
// plain system calls only (the parent may have threads when it forks).
class EchoFloor {
 public:
  EchoFloor() = default;
  ~EchoFloor() { stop(); }
  EchoFloor(const EchoFloor&) = delete;
  EchoFloor& operator=(const EchoFloor&) = delete;

  // A Unix stream socket pair; the echo process reads a whole request (the
  // requests' lengths tell which), then writes its answer.
  bool startSocket(const std::vector<Exchange>& exchanges) {
    int sv[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv) != 0) return false;
    mExchanges = exchanges;
    return start(sv[0], sv[1], /*byLine=*/false);
  }

  // A pty in raw mode: the benchmark writes to the terminal side, as the
  // daemon writes to a modem port, and the echo process answers on the
  // master side once it has read a line up to CR.
  bool startPty(const std::vector<Exchange>& exchanges) {
    int master = posix_openpt(O_RDWR | O_NOCTTY | O_CLOEXEC);
    if (master < 0 || grantpt(master) != 0 || unlockpt(master) != 0) return false;
    char name[128];
    if (ptsname_r(master, name, sizeof(name)) != 0) return false;
    int slave = ::open(name, O_RDWR | O_NOCTTY | O_CLOEXEC);
    if (slave < 0) return false;
    struct termios t;
    if (tcgetattr(slave, &t) != 0) return false;
    cfmakeraw(&t);
    if (tcsetattr(slave, TCSANOW, &t) != 0) return false;
    mExchanges = exchanges;
    return start(slave, master, /*byLine=*/true);
  }

  // One round trip of exchange `i`; false when the answer is not the one
  // prepared (or the channel broke).
  bool roundTrip(size_t i) {
    const Exchange& e = mExchanges[i];
    mBuf.resize(e.answer.size());
    if (!floors_detail::writeFully(mFd, e.request.data(), e.request.size())) return false;
    if (!floors_detail::readFully(mFd, mBuf.data(), mBuf.size())) return false;
    return mBuf == e.answer;
  }

  void stop() {
    if (mFd >= 0) ::close(mFd);
    mFd = -1;
    if (mPid > 0) {
      kill(mPid, SIGKILL);
      waitpid(mPid, nullptr, 0);
    }
    mPid = -1;
  }

  pid_t pid() const { return mPid; }

 private:
  bool start(int mine, int theirs, bool byLine) {
    // Everything the child uses is made before the fork.
    size_t longest = 0;
    for (const Exchange& e : mExchanges) longest = std::max(longest, e.request.size());
    std::vector<uint8_t> in(longest + 1);
    mPid = fork();
    if (mPid < 0) {
      ::close(mine);
      ::close(theirs);
      return false;
    }
    if (mPid == 0) {
      ::close(mine);
      serve(theirs, in, byLine);
      _exit(0);
    }
    ::close(theirs);
    mFd = mine;
    return true;
  }

  // In the child: answers requests until the channel closes.
  void serve(int fd, std::vector<uint8_t>& in, bool byLine) {
    size_t have = 0;
    for (;;) {
      ssize_t r = ::read(fd, in.data() + have, in.size() - have);
      if (r < 0 && errno == EINTR) continue;
      if (r <= 0) return;
      have += static_cast<size_t>(r);
      const Exchange* hit = nullptr;
      for (const Exchange& e : mExchanges) {
        if (byLine ? (in[have - 1] == '\r' && e.request.size() == have) : e.request.size() == have) {
          hit = &e;
          break;
        }
      }
      if (hit == nullptr) {
        if (have >= in.size()) return;  // not a request of ours
        continue;
      }
      have = 0;
      if (!floors_detail::writeFully(fd, hit->answer.data(), hit->answer.size())) return;
    }
  }

  std::vector<Exchange> mExchanges;
  std::vector<uint8_t> mBuf;
  int mFd = -1;
  pid_t mPid = -1;
};

}  // namespace se_bench

#include "rpc_io.h"

#include <host/unix_socket.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <cerrno>
#include <chrono>
#include <cstring>

namespace android {
namespace host {
namespace rpc {

int64_t nowMs() {
  return std::chrono::duration_cast<std::chrono::milliseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

int remainingMs(int64_t deadline) {
  if (deadline < 0) return -1;
  int64_t left = deadline - nowMs();
  if (left <= 0) return 0;
  return left > 1000000000 ? 1000000000 : static_cast<int>(left);
}

bool writeAll(int fd, const std::vector<uint8_t>& data, int stallMs) {
  const uint8_t* p = data.data();
  size_t left = data.size();
  while (left > 0) {
    ssize_t w = send(fd, p, left, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (w > 0) {
      p += w;
      left -= static_cast<size_t>(w);
      continue;
    }
    if (w < 0 && errno == EINTR) continue;
    if (w < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      pollfd pfd{fd, POLLOUT, 0};
      int r = poll(&pfd, 1, stallMs);
      if (r < 0 && errno == EINTR) continue;
      if (r <= 0 || (pfd.revents & (POLLERR | POLLNVAL))) return false;
      continue;
    }
    return false;
  }
  return true;
}

bool sendFrame(int fd, const Frame& f, int stallMs) {
  std::vector<uint8_t> bytes;
  return encodeFrame(f, &bytes) && writeAll(fd, bytes, stallMs);
}

Frame errorFrame(uint32_t id, const std::string& text) {
  Frame f;
  f.kind = FrameKind::Error;
  f.id = id;
  f.code = static_cast<uint32_t>(FAILED_TRANSACTION);
  BodyWriter w;
  w.text(text.size() > kMaxErrorText ? text.substr(0, kMaxErrorText) : text);
  f.body = w.take();
  return f;
}

hardware::Status statusOfAnswer(Frame& answer, std::vector<uint8_t>* reply) {
  if (answer.kind == FrameKind::Error) {
    BodyReader r(answer.body);
    std::string text;
    if (!r.text(&text, kMaxErrorText) || !r.finished()) text = "call failed";
    return transportError(text);
  }
  if (reply) *reply = std::move(answer.body);
  return hardware::Status::ok();
}

bool validServiceName(const std::string& name) {
  if (name.empty() || name == "." || name == "..") return false;
  for (char c : name) {
    if (c == '/' || c == '\0') return false;
  }
  return true;
}

bool makeDirs(const std::string& dir) {
  // Parents as usual; the socket folder itself private to the daemon's user.
  for (size_t pos = 1; pos <= dir.size(); ++pos) {
    if (pos != dir.size() && dir[pos] != '/') continue;
    std::string part = dir.substr(0, pos);
    bool last = pos == dir.size();
    if (mkdir(part.c_str(), last ? 0700 : 0755) != 0 && errno != EEXIST) return false;
  }
  struct stat st;
  if (stat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return false;
  return chmod(dir.c_str(), 0700) == 0;
}

int connectTo(const std::string& path, std::string* error) {
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (fd.get() < 0) {
    if (error) *error = strerror(errno);
    return -1;
  }
  if (!connectUnixAt(fd.get(), path, error)) return -1;
  return fd.release();
}

}  // namespace rpc
}  // namespace host
}  // namespace android

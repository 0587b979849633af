#include <host/unix_socket.h>

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

namespace android {
namespace host {

namespace {

// A socket address for `path`, and the folder descriptor it may go through
// (closed with the address, after the bind or connect).
class UnixAddress {
 public:
  UnixAddress() { memset(&mAddr, 0, sizeof(mAddr)); }
  ~UnixAddress() {
    if (mDirFd >= 0) close(mDirFd);
  }
  UnixAddress(const UnixAddress&) = delete;
  UnixAddress& operator=(const UnixAddress&) = delete;

  bool make(const std::string& path, std::string* error) {
    mAddr.sun_family = AF_UNIX;
    if (path.empty()) return fail(error, "an empty socket path");
    if (path.size() < sizeof(mAddr.sun_path)) return put(path);
    const size_t slash = path.rfind('/');
    const std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
    if (slash == std::string::npos || name.empty()) {
      return fail(error, path + ": longer than a Unix socket address holds (" +
                             std::to_string(sizeof(mAddr.sun_path) - 1) + " bytes)");
    }
    const std::string dir = slash == 0 ? "/" : path.substr(0, slash);
    // openat, not open: on a host the daemon's open() resolves absolute paths
    // under the device root, and this path is already resolved.
    mDirFd = openat(AT_FDCWD, dir.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    if (mDirFd < 0) return fail(error, path + ": cannot open its folder: " + strerror(errno));
    char via[sizeof(mAddr.sun_path) + 32];
    snprintf(via, sizeof(via), "/proc/self/fd/%d/", mDirFd);
    const std::string relative = via + name;
    if (relative.size() >= sizeof(mAddr.sun_path)) {
      return fail(error, path + ": the socket name " + name +
                             " is too long for a Unix socket address even relative to its folder");
    }
    if (faccessat(AT_FDCWD, via, F_OK, 0) != 0) {
      return fail(error, path + ": longer than a Unix socket address holds, and " + via +
                             " to reach it relative to its folder is not there: " + strerror(errno));
    }
    return put(relative);
  }

  const sockaddr* get() const { return reinterpret_cast<const sockaddr*>(&mAddr); }
  socklen_t size() const { return sizeof(mAddr); }

 private:
  bool put(const std::string& text) {
    memcpy(mAddr.sun_path, text.c_str(), text.size() + 1);
    return true;
  }
  static bool fail(std::string* error, const std::string& why) {
    if (error) *error = why;
    return false;
  }

  sockaddr_un mAddr;
  int mDirFd = -1;
};

}  // namespace

bool bindUnixAt(int fd, const std::string& path, std::string* error) {
  UnixAddress addr;
  if (!addr.make(path, error)) return false;
  if (bind(fd, addr.get(), addr.size()) != 0) {
    if (error) *error = path + ": " + strerror(errno);
    return false;
  }
  return true;
}

bool connectUnixAt(int fd, const std::string& path, std::string* error) {
  UnixAddress addr;
  if (!addr.make(path, error)) return false;
  int r;
  do {
    r = connect(fd, addr.get(), addr.size());
  } while (r != 0 && errno == EINTR);
  if (r != 0) {
    if (error) *error = strerror(errno);
    return false;
  }
  return true;
}

}  // namespace host
}  // namespace android

// Registration: the listening sockets of the instances served, and taking
// in the connections made to them.
#include "rpc_pool.h"

#include <host/device_root.h>
#include <host/rpc_host.h>

#include <dirent.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace android {
namespace host {
namespace rpc {

// Listens for `name` in the socket folder `dir`: HIDL and AIDL instances
// differ only in their folder and share this loop and pool.
status_t Host::add(const std::string& dir, const std::string& name,
                   const sp<IBase>& service, StubFn stub) {
  if (!validServiceName(name) || service == nullptr || stub == nullptr) {
    RPC_LOGE("cannot register instance \"%s\": invalid name or object", name.c_str());
    return BAD_VALUE;
  }
  std::string path = dir + "/" + name;
  sockaddr_un addr;
  if (!fillAddress(path, &addr)) {
    RPC_LOGE("cannot register %s: socket path too long", path.c_str());
    return BAD_VALUE;
  }
  std::lock_guard<std::mutex> g(mLock);
  for (auto& l : mListeners) {
    if (l->path == path) {
      // Registering a name again replaces the object served under it.
      l->service = service;
      l->stub = stub;
      return OK;
    }
  }
  if (!makeDirs(dir)) {
    RPC_LOGE("cannot create %s: %s", dir.c_str(), strerror(errno));
    return UNKNOWN_ERROR;
  }
  struct stat st;
  if (lstat(path.c_str(), &st) == 0) {
    if (!S_ISSOCK(st.st_mode)) {
      RPC_LOGE("cannot register %s: a file that is not a socket is in the way", path.c_str());
      return UNKNOWN_ERROR;
    }
    unlink(path.c_str());  // left behind by an earlier run
  }
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (fd.get() < 0 || bind(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 ||
      chmod(path.c_str(), 0600) != 0 || listen(fd.get(), 64) != 0) {
    RPC_LOGE("cannot listen on %s: %s", path.c_str(), strerror(errno));
    return UNKNOWN_ERROR;
  }
  auto l = std::make_unique<Listener>();
  l->name = name;
  l->path = path;
  l->fd = std::move(fd);
  l->service = service;
  l->stub = stub;
  mListeners.push_back(std::move(l));
  if (!startLocked()) return UNKNOWN_ERROR;
  if (!control(EPOLL_CTL_ADD, mListeners.back()->fd.get(), listenerKey(mListeners.size() - 1))) {
    RPC_LOGE("cannot poll %s: %s", path.c_str(), strerror(errno));
    return UNKNOWN_ERROR;
  }
  return OK;
}

void Host::acceptSome(Listener* l) {
  for (int i = 0; i < 16; ++i) {
    UniqueFd fd(accept4(l->fd.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (fd.get() < 0) return;
    ucred cred{};
    socklen_t len = sizeof(cred);
    if (getsockopt(fd.get(), SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
      RPC_LOGE("refused connection to %s: peer credentials unknown", l->name.c_str());
      continue;
    }
    if (cred.uid != geteuid() && cred.uid != 0) {
      RPC_LOGE("refused connection to %s from uid %u (pid %d)", l->name.c_str(),
               static_cast<unsigned>(cred.uid), static_cast<int>(cred.pid));
      continue;
    }
    std::lock_guard<std::mutex> g(mLock);
    if (mConns.size() >= kMaxConnections) {
      RPC_LOGE("refused connection to %s from pid %d: too many connections", l->name.c_str(),
               static_cast<int>(cred.pid));
      continue;
    }
    const uint64_t id = ++mNextConnId;
    int raw = fd.get();
    auto c = std::make_shared<ServerConn>(std::move(fd), l->name, l->service, l->stub,
                                          cred.pid, cred.uid, id);
    mConns[id] = c;
    if (!control(EPOLL_CTL_ADD, raw, (id << 2) | kConn, kConnEvents)) {
      RPC_LOGE("cannot poll a connection to %s: %s", l->name.c_str(), strerror(errno));
      mConns.erase(id);
    }
  }
}

status_t registerService(const std::string&, const std::string& name, const sp<IBase>& service,
                         StubFn stub) {
  return Host::get().add(serviceSocketDir(), name, service, stub);
}

status_t registerServiceIn(const std::string& dir, const std::string& name,
                           const sp<IBase>& service, StubFn stub) {
  return Host::get().add(dir, name, service, stub);
}

}  // namespace rpc

std::string serviceSocketDir() { return mapDevicePath("/dev/socket/secure_element"); }

std::string serviceSocketPath(const std::string& name) { return serviceSocketDir() + "/" + name; }

std::vector<std::string> listServices() {
  std::vector<std::string> names;
  std::string dir = serviceSocketDir();
  DIR* d = opendir(dir.c_str());
  if (d == nullptr) return names;
  while (dirent* e = readdir(d)) {
    std::string name = e->d_name;
    if (name == "." || name == "..") continue;
    std::string path = dir + "/" + name;
    struct stat st;
    if (lstat(path.c_str(), &st) != 0 || !S_ISSOCK(st.st_mode)) continue;
    int fd = rpc::connectTo(path, nullptr);
    if (fd < 0) continue;  // left behind by a daemon that is gone
    close(fd);
    names.push_back(name);
  }
  closedir(d);
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace host
}  // namespace android

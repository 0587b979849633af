// Generic RPC transport over Unix-domain stream sockets: registration of
// instances, the server's pool (whose threads take turns reading and run the
// calls they read), server connections with their death links, and the
// client connection. Knows frames and object ids,
// not the interfaces carried over them.
#include "rpc_internal.h"

#include <android/log.h>
#include <hidl/HidlTransportSupport.h>
#include <host/device_root.h>
#include <host/rpc_hooks.h>
#include <host/rpc_host.h>

#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <map>
#include <mutex>
#include <set>
#include <thread>

#define RPC_LOGE(...) __android_log_print(ANDROID_LOG_ERROR, kLogTag, __VA_ARGS__)

namespace android {
namespace host {

namespace {
std::atomic<RpcHooks*> g_hooks{nullptr};
}  // namespace

void setRpcHooks(RpcHooks* hooks) { g_hooks.store(hooks); }

namespace rpc {

RpcHooks* currentHooks() { return g_hooks.load(); }

hardware::Status transportError(const std::string& message) {
  return hardware::Status::fromExceptionCode(hardware::Status::EX_TRANSACTION_FAILED, message);
}

namespace {

using hidl::base::V1_0::IBase;

constexpr size_t kMaxConnections = 256;
// Calls of one connection queued or running at once; beyond this the pool
// stops reading that connection until some finish.
constexpr int kMaxInflightPerConnection = 8;
// A peer that accepts no bytes of a reply for this long is dropped.
constexpr int kWriteStallMs = 10000;
constexpr size_t kReadChunk = 65536;
// Events a pool thread takes from the kernel at once.
constexpr int kEventsAtOnce = 32;
// Reads of a connection whose peer has stopped sending, in one turn.
constexpr int kReadRoundsToEnd = 64;

class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : mFd(fd) {}
  ~UniqueFd() { reset(); }
  UniqueFd(UniqueFd&& o) noexcept : mFd(o.release()) {}
  UniqueFd& operator=(UniqueFd&& o) noexcept {
    if (this != &o) reset(o.release());
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  int get() const { return mFd; }
  int release() {
    int fd = mFd;
    mFd = -1;
    return fd;
  }
  void reset(int fd = -1) {
    if (mFd >= 0) close(mFd);
    mFd = fd;
  }

 private:
  int mFd = -1;
};

int64_t nowMs() {
  return std::chrono::duration_cast<std::chrono::milliseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

// Milliseconds left until `deadline` (< 0: none) for poll().
int remainingMs(int64_t deadline) {
  if (deadline < 0) return -1;
  int64_t left = deadline - nowMs();
  if (left <= 0) return 0;
  return left > 1000000000 ? 1000000000 : static_cast<int>(left);
}

// Writes all of `data`, waiting while the socket is full; gives up after
// stallMs (< 0: never) without progress.
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

// The outcome of a call as carried by its answering frame.
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

struct DeathLink {
  sp<hardware::hidl_death_recipient> recipient;
  uint64_t cookie;
  wp<IBase> who;
};

bool validServiceName(const std::string& name) {
  if (name.empty() || name == "." || name == "..") return false;
  for (char c : name) {
    if (c == '/' || c == '\0') return false;
  }
  return true;
}

bool fillAddress(const std::string& path, sockaddr_un* addr) {
  memset(addr, 0, sizeof(*addr));
  addr->sun_family = AF_UNIX;
  if (path.size() >= sizeof(addr->sun_path)) return false;
  memcpy(addr->sun_path, path.c_str(), path.size() + 1);
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

// ---------------------------------------------------------------------------
// Server side

class ServerConn;
// A thread in a call to a client waits for the answer by reading the
// client's connection itself (defined with the pool below): the pool's
// threads may all be busy.
void readWhileWaiting(const std::shared_ptr<ServerConn>& conn, int wakeFd);

class ServerConn : public RemotePeer, public std::enable_shared_from_this<ServerConn> {
 public:
  ServerConn(UniqueFd fd, std::string name, sp<IBase> service, StubFn stub, pid_t pid,
             uint64_t id)
      : mFd(std::move(fd)),
        mName(std::move(name)),
        mService(std::move(service)),
        mStub(stub),
        mPid(pid),
        mId(id) {}

  int fd() const { return mFd.get(); }
  const std::string& name() const { return mName; }
  pid_t pid() const { return mPid; }
  uint64_t id() const { return mId; }

  // Whoever reads the connection holds readLock: the decoder and
  // readClosed are theirs.
  std::mutex readLock;
  FrameDecoder decoder;
  bool readClosed = false;
  // Under the pool's lock: calls queued or running, and whether reading
  // waits for some of them to finish.
  int inflight = 0;
  bool parked = false;

  // Runs one incoming call on a pool thread.
  void serveCall(const Frame& f) {
    if (f.object != 0) {
      RPC_LOGE("closing connection to %s from pid %d: call to unknown object %u", mName.c_str(),
               mPid, f.object);
      abort();
      return;
    }
    sp<IBase> service;
    {
      std::lock_guard<std::mutex> g(mLock);
      service = mService;
    }
    if (service == nullptr) return;  // closed meanwhile
    BodyReader in(f.body);
    BodyWriter out;
    std::string error;
    StubResult r = mStub(service, f.code, in, out, shared_from_this(), &error);
    switch (r) {
      case StubResult::Replied: {
        Frame reply;
        reply.kind = FrameKind::Reply;
        reply.id = f.id;
        reply.body = out.take();
        send(reply);
        return;
      }
      case StubResult::NoReply:
      case StubResult::Failed:
        send(errorFrame(f.id, error.empty() ? "call failed" : error));
        return;
      case StubResult::BadCall:
        RPC_LOGE("closing connection to %s from pid %d: malformed call %u: %s", mName.c_str(),
                 mPid, f.code, error.c_str());
        abort();
        return;
    }
  }

  // An answer to one of our calls; false when none is waiting for it.
  bool deliverAnswer(Frame&& f) {
    std::lock_guard<std::mutex> g(mLock);
    auto it = mPending.find(f.id);
    if (it == mPending.end() || it->second->done) return false;
    it->second->frame = std::move(f);
    it->second->done = true;
    // Under the lock: the waiting call closes its descriptor once it sees
    // the answer.
    poke(it->second->wakeFd);
    return true;
  }

  // The connection ended (by whoever holds readLock): ends waiting calls,
  // closes the socket and hands back the death links. The service
  // reference goes too: the service may keep this client's callback proxy,
  // which refers back here.
  std::vector<DeathLink> markClosed() {
    std::vector<DeathLink> links;
    std::map<uint32_t, wp<IBase>> proxies;
    sp<IBase> service;
    {
      std::lock_guard<std::mutex> g(mLock);
      mClosed = true;
      links.swap(mLinks);
      proxies.swap(mProxies);
      service = mService;
      mService = nullptr;
      for (auto& p : mPending) poke(p.second->wakeFd);
    }
    // Unblocks a writer waiting on a full socket before taking its lock.
    shutdown(mFd.get(), SHUT_RDWR);
    std::lock_guard<std::mutex> g(mWriteLock);
    mFd.reset();
    return links;
  }

  // Ends the connection from a pool thread; whoever reads it next sees the
  // hang-up and cleans up.
  void abort() {
    std::lock_guard<std::mutex> g(mWriteLock);
    if (mFd.get() >= 0) shutdown(mFd.get(), SHUT_RDWR);
  }

  hardware::Status call(uint32_t object, uint32_t method, const BodyWriter& args,
                        std::vector<uint8_t>* reply) override {
    if (!args.ok()) return transportError("arguments exceed the frame limit");
    // Tells this thread that a pool thread read its answer (or the end).
    UniqueFd wake(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (wake.get() < 0) return transportError("cannot wait for the client");
    auto pending = std::make_shared<Pending>();
    pending->wakeFd = wake.get();
    Frame f;
    {
      std::lock_guard<std::mutex> g(mLock);
      if (mClosed) return transportError("client connection closed");
      if (++mNextId == 0) ++mNextId;
      f.id = mNextId;
      mPending[f.id] = pending;
    }
    f.kind = FrameKind::Call;
    f.object = object;
    f.code = method;
    f.body = args.data();
    if (!send(f)) {
      abort();
      std::lock_guard<std::mutex> g(mLock);
      mPending.erase(f.id);
      return transportError("cannot send to client");
    }
    for (;;) {
      {
        std::lock_guard<std::mutex> g(mLock);
        if (pending->done || mClosed) {
          mPending.erase(f.id);
          break;
        }
      }
      readWhileWaiting(shared_from_this(), wake.get());
    }
    if (!pending->done) return transportError("client connection closed");
    return statusOfAnswer(pending->frame, reply);
  }

  bool linkToDeath(const sp<hardware::hidl_death_recipient>& recipient, uint64_t cookie,
                   const wp<IBase>& who) override {
    if (recipient == nullptr) return false;
    std::lock_guard<std::mutex> g(mLock);
    if (mClosed) return false;
    mLinks.push_back({recipient, cookie, who});
    return true;
  }

  bool unlinkToDeath(const sp<hardware::hidl_death_recipient>& recipient,
                     const wp<IBase>& who) override {
    std::vector<DeathLink> removed;  // released outside the lock
    std::lock_guard<std::mutex> g(mLock);
    auto keep = std::stable_partition(mLinks.begin(), mLinks.end(), [&](const DeathLink& l) {
      return !(l.recipient == recipient && l.who == who);
    });
    if (keep == mLinks.end()) return false;
    removed.assign(std::make_move_iterator(keep), std::make_move_iterator(mLinks.end()));
    mLinks.erase(keep, mLinks.end());
    return true;
  }

  // Objects of the daemon are not handed to clients.
  bool exportObject(const sp<IBase>&, StubFn, uint32_t*) override { return false; }

  sp<IBase> importObject(uint32_t id, const ProxyFactory& make) override {
    std::lock_guard<std::mutex> g(mLock);
    auto it = mProxies.find(id);
    if (it != mProxies.end()) {
      sp<IBase> existing = it->second.promote();
      if (existing != nullptr) return existing;
    }
    sp<IBase> proxy = make(shared_from_this(), id);
    if (!mClosed) mProxies[id] = proxy;
    return proxy;
  }

  int pollIncoming(int) override { return -1; }
  void setCallTimeout(int) override {}

 private:
  struct Pending {
    bool done = false;
    Frame frame;
    int wakeFd = -1;  // owned by the waiting call; valid while it is pending
  };

  static void poke(int fd) {
    if (fd < 0) return;
    uint64_t one = 1;
    ssize_t unused = write(fd, &one, sizeof(one));
    (void)unused;
  }

  bool send(const Frame& f) {
    std::lock_guard<std::mutex> g(mWriteLock);
    return mFd.get() >= 0 && sendFrame(mFd.get(), f, kWriteStallMs);
  }

  UniqueFd mFd;  // closed under readLock and mWriteLock
  const std::string mName;
  sp<IBase> mService;  // null once closed
  const StubFn mStub;
  const pid_t mPid;
  const uint64_t mId;
  std::mutex mWriteLock;  // keeps frames whole
  std::mutex mLock;
  bool mClosed = false;
  uint32_t mNextId = 0;
  std::map<uint32_t, std::shared_ptr<Pending>> mPending;
  std::vector<DeathLink> mLinks;
  std::map<uint32_t, wp<IBase>> mProxies;
};

struct Listener {
  std::string name;
  std::string path;
  UniqueFd fd;
  sp<IBase> service;
  StubFn stub = nullptr;
};

// Work for a pool thread: a call read from a connection, or a death notice.
struct Task {
  std::shared_ptr<ServerConn> conn;  // set: run `frame` as a call on it
  Frame frame;
  DeathLink death{};  // else: tell this recipient
};

// The server's pool. There is no I/O thread: the idle pool threads all wait
// for input in one epoll set, and the kernel wakes one of them per event.
// Every socket is armed for one event at a time, so one thread reads a
// connection at once; it arms it again once it has read, then runs the
// call it read itself. A call therefore costs no hand-over between threads
// and no thread is woken but the one that runs it. At most mMaxThreads
// calls (and death notices) run at once, the joining thread being one of
// the pool; calls beyond that wait in the queue. A thread in a call to a
// client reads that client's connection itself while it waits for the
// answer, so the answer is read even when every pool thread is busy.
class Host {
 public:
  static Host& get() {
    static Host* host = new Host();  // outlives static destructors and detached users
    return *host;
  }

  void configure(size_t maxThreads, bool callerWillJoin) {
    std::lock_guard<std::mutex> g(mLock);
    mMaxThreads = maxThreads == 0 ? 1 : maxThreads;
    mCallerJoins = callerWillJoin;
    if (mRunning) spawnWorkersLocked();
  }

  // Listens for `name` in the socket folder `dir`: HIDL and AIDL instances
  // differ only in their folder and share this loop and pool.
  status_t add(const std::string& dir, const std::string& name, const sp<IBase>& service,
               StubFn stub) {
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

  void join() {
    {
      std::lock_guard<std::mutex> g(mLock);
      if (!startLocked()) return;
      ++mActiveJoiners;
    }
    workerLoop();
    std::lock_guard<std::mutex> g(mLock);
    --mActiveJoiners;
    mJoinCv.notify_all();
  }

  // A call on `c` waits for its answer: reads what the connection has, then
  // waits until it has more or `wakeFd` tells that a pool thread read it.
  // A connection with its most calls queued is not read here either; only
  // its end is watched for.
  void readWhileWaiting(const std::shared_ptr<ServerConn>& c, int wakeFd) {
    bool full;
    {
      std::lock_guard<std::mutex> g(mLock);
      full = c->inflight >= kMaxInflightPerConnection;
    }
    std::vector<Task> fresh;
    int fd = -1;
    {
      std::lock_guard<std::mutex> rg(c->readLock);
      if (!c->readClosed) {
        fd = c->fd();
        if (!full && !readConn(c, &fresh, false)) {
          closeConnLocked(c, &fresh);
          fd = -1;
        }
      }
    }
    if (!fresh.empty()) queue(fresh);
    if (fd < 0) return;  // closed: the caller sees it
    pollfd p[2] = {{fd, static_cast<short>(full ? 0 : POLLIN), 0}, {wakeFd, POLLIN, 0}};
    if (poll(p, 2, -1) <= 0) return;
    if (p[1].revents) {
      uint64_t drain;
      ssize_t unused = read(wakeFd, &drain, sizeof(drain));
      (void)unused;
    }
    if (full && (p[0].revents & (POLLHUP | POLLERR))) {
      {
        std::lock_guard<std::mutex> rg(c->readLock);
        if (!c->readClosed) closeConnLocked(c, &fresh);
      }
      if (!fresh.empty()) queue(fresh);
    }
  }

  void shutdownHost() {
    std::vector<std::thread> workers;
    std::map<uint64_t, std::shared_ptr<ServerConn>> conns;
    {
      std::unique_lock<std::mutex> lk(mLock);
      mStopping = true;
      // Level-triggered and never drained: every waiting thread sees it.
      if (mStopFd.get() >= 0) {
        uint64_t one = 1;
        ssize_t unused = write(mStopFd.get(), &one, sizeof(one));
        (void)unused;
      }
      workers.swap(mWorkers);
      // Threads that read from sockets finish first; nobody starts again.
      mJoinCv.wait(lk, [&] { return mHandling == 0; });
      conns.swap(mConns);
    }
    // Stopping: no death notices, just end whatever waits on these clients.
    for (auto& c : conns) {
      std::lock_guard<std::mutex> rg(c.second->readLock);
      c.second->readClosed = true;
      c.second->markClosed();
    }
    conns.clear();
    for (auto& w : workers) w.join();
    std::deque<Task> dropped;
    std::vector<std::unique_ptr<Listener>> listeners;
    {
      std::unique_lock<std::mutex> lk(mLock);
      mJoinCv.wait(lk, [&] { return mActiveJoiners == 0; });
      dropped.swap(mTasks);
      listeners.swap(mListeners);
      mSpawned = 0;
      mBusy = 0;
      mRunning = false;
      mStopping = false;
      mEpoll.reset();
      mStopFd.reset();
      mWorkFd.reset();
    }
    for (auto& l : listeners) unlink(l->path.c_str());
  }

 private:
  Host() = default;

  // What an epoll event stands for: the low two bits the kind, the rest a
  // connection id or a listener's index.
  enum Kind : uint64_t { kConn = 0, kListener = 1, kStop = 2, kWork = 3 };
  static uint64_t listenerKey(size_t index) { return (uint64_t(index) << 2) | kListener; }
  // A connection is armed for input and for its peer's end of sending.
  static constexpr uint32_t kConnEvents = EPOLLIN | EPOLLRDHUP | EPOLLONESHOT;

  // Arms `fd` for one event.
  bool control(int op, int fd, uint64_t key, uint32_t events = EPOLLIN | EPOLLONESHOT) {
    epoll_event ev{};
    ev.events = events;
    ev.data.u64 = key;
    return epoll_ctl(mEpoll.get(), op, fd, &ev) == 0;
  }

  bool startLocked() {
    if (!mRunning) {
      UniqueFd ep(epoll_create1(EPOLL_CLOEXEC));
      UniqueFd stop(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
      UniqueFd work(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
      if (ep.get() < 0 || stop.get() < 0 || work.get() < 0) {
        RPC_LOGE("cannot set up the pool: %s", strerror(errno));
        return false;
      }
      mEpoll = std::move(ep);
      mStopFd = std::move(stop);
      mWorkFd = std::move(work);
      if (!control(EPOLL_CTL_ADD, mStopFd.get(), kStop, EPOLLIN) ||
          !control(EPOLL_CTL_ADD, mWorkFd.get(), kWork)) {
        RPC_LOGE("cannot set up the pool: %s", strerror(errno));
        mEpoll.reset();
        return false;
      }
      mRunning = true;
    }
    spawnWorkersLocked();
    return true;
  }

  void spawnWorkersLocked() {
    size_t want = mCallerJoins ? mMaxThreads - 1 : mMaxThreads;
    while (mSpawned < want) {
      mWorkers.emplace_back([this] { workerLoop(); });
      ++mSpawned;
    }
  }

  // Pool threads and joiners: run what is queued, else wait for input.
  void workerLoop() {
    std::unique_lock<std::mutex> lk(mLock);
    Task task;
    for (;;) {
      if (mStopping || !mRunning) return;
      if (!mTasks.empty() && mBusy < mMaxThreads) {
        task = std::move(mTasks.front());
        mTasks.pop_front();
        ++mBusy;
        const bool more = !mTasks.empty() && mBusy < mMaxThreads && mWaiting > 0;
        lk.unlock();
        if (more) signalWork();
        run(task, lk);
        continue;
      }
      const int ep = mEpoll.get();
      ++mWaiting;
      lk.unlock();
      // All that is ready at once: what is taken together is handled in
      // one go, and a call read here runs here, now, unless the pool is
      // full (the loop's top takes it).
      epoll_event evs[kEventsAtOnce];
      int n = epoll_wait(ep, evs, kEventsAtOnce, -1);
      lk.lock();
      --mWaiting;
      for (int i = 0; i < n && !mStopping; ++i) handle(evs[i], lk);
    }
  }

  // Runs `task` counted as busy (the lock is released meanwhile) and
  // returns with the lock held.
  void run(Task& task, std::unique_lock<std::mutex>& lk) {
    if (lk.owns_lock()) lk.unlock();
    if (task.conn == nullptr) {
      if (task.death.recipient != nullptr) {
        task.death.recipient->serviceDied(task.death.cookie, task.death.who);
      }
      task = Task();
      lk.lock();
      --mBusy;
      return;
    }
    task.conn->serveCall(task.frame);
    std::shared_ptr<ServerConn> c = std::move(task.conn);
    task = Task();
    lk.lock();
    --mBusy;
    if (--c->inflight < kMaxInflightPerConnection && c->parked) {
      c->parked = false;
      armLocked(*c);
    }
    lk.unlock();
    c.reset();  // the last reference may go here; not under the lock
    lk.lock();
  }

  // One event, with the lock held on entry and return; calls and death
  // notices go to the queue.
  void handle(const epoll_event& ev, std::unique_lock<std::mutex>& lk) {
    const uint64_t key = ev.data.u64;
    switch (key & 3) {
      case kStop:
        return;
      case kWork: {
        uint64_t drain;
        ssize_t unused = read(mWorkFd.get(), &drain, sizeof(drain));
        (void)unused;
        control(EPOLL_CTL_MOD, mWorkFd.get(), kWork);
        return;  // the loop takes what is queued
      }
      case kListener: {
        size_t index = static_cast<size_t>(key >> 2);
        if (index >= mListeners.size()) return;
        Listener* l = mListeners[index].get();
        ++mHandling;
        lk.unlock();
        acceptSome(l);
        lk.lock();
        doneHandling();
        if (!mStopping) control(EPOLL_CTL_MOD, l->fd.get(), key);
        return;
      }
      default:
        break;
    }
    auto it = mConns.find(key >> 2);
    if (it == mConns.end()) return;  // closed meanwhile
    std::shared_ptr<ServerConn> c = it->second;
    if (c->inflight >= kMaxInflightPerConnection) {
      // Read again once some of its calls have finished.
      c->parked = true;
      return;
    }
    ++mHandling;
    lk.unlock();
    // Kept per thread: one read per call, and its storage need not be
    // allocated anew each time.
    thread_local std::vector<Task> fresh;
    bool alive;
    {
      std::lock_guard<std::mutex> rg(c->readLock);
      if (c->readClosed) {
        relock(lk);
        return;
      }
      alive = readConn(c, &fresh, (ev.events & (EPOLLRDHUP | EPOLLHUP)) != 0);
      if (!alive) closeConnLocked(c, &fresh);
    }
    lk.lock();
    doneHandling();
    for (Task& t : fresh) {
      if (t.conn) ++t.conn->inflight;
      mTasks.push_back(std::move(t));
    }
    fresh.clear();
    if (alive) armLocked(*c);
    if (c.use_count() == 1) {
      // The last reference: the connection goes, not under the lock.
      lk.unlock();
      c.reset();
      lk.lock();
    }
  }

  // Lets the next event of `c` in, or parks it while it has its most calls
  // queued or running. Only while it is in the set: once out, its socket
  // may be closed and its number given to another.
  void armLocked(ServerConn& c) {
    if (mStopping || mConns.count(c.id()) == 0) return;
    if (c.inflight >= kMaxInflightPerConnection) {
      c.parked = true;
      return;
    }
    control(EPOLL_CTL_MOD, c.fd(), (c.id() << 2) | kConn, kConnEvents);
  }

  void relock(std::unique_lock<std::mutex>& lk) {
    lk.lock();
    doneHandling();
  }

  void doneHandling() {
    if (--mHandling == 0 && mStopping) mJoinCv.notify_all();
  }

  // Queues tasks read by a thread that cannot run them (it is in a call).
  void queue(std::vector<Task>& fresh) {
    std::vector<Task> dropped;  // released outside the lock
    std::lock_guard<std::mutex> g(mLock);
    if (mStopping || !mRunning) {
      dropped.swap(fresh);
      return;
    }
    for (Task& t : fresh) {
      if (t.conn) ++t.conn->inflight;
      mTasks.push_back(std::move(t));
    }
    fresh.clear();
    if (mBusy < mMaxThreads && mWaiting > 0) signalWork();
  }

  // Wakes one waiting pool thread to take queued work.
  void signalWork() {
    uint64_t one = 1;
    ssize_t unused = write(mWorkFd.get(), &one, sizeof(one));
    (void)unused;
  }

  void acceptSome(Listener* l) {
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
                                            cred.pid, id);
      mConns[id] = c;
      if (!control(EPOLL_CTL_ADD, raw, (id << 2) | kConn, kConnEvents)) {
        RPC_LOGE("cannot poll a connection to %s: %s", l->name.c_str(), strerror(errno));
        mConns.erase(id);
      }
    }
  }

  // Reads what is there (readLock held); false when the connection is to
  // be closed. Calls go to *fresh, answers to their waiting calls. Once the
  // peer has stopped sending (`toEnd`), reads up to the end at once, so its
  // end is seen in the same turn as its last bytes.
  bool readConn(const std::shared_ptr<ServerConn>& c, std::vector<Task>* fresh, bool toEnd) {
    for (int round = 0; round < kReadRoundsToEnd; ++round) {
      if (!readChunk(c, fresh)) return false;
      if (!toEnd) break;
    }
    return true;
  }

  // One recv's worth; false when the connection is to be closed.
  bool readChunk(const std::shared_ptr<ServerConn>& c, std::vector<Task>* fresh) {
    uint8_t buf[kReadChunk];
    ssize_t n = recv(c->fd(), buf, sizeof(buf), MSG_DONTWAIT);
    if (n < 0) return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR;
    if (n == 0) {
      if (c->decoder.pending() > 0) {
        RPC_LOGE("connection to %s from pid %d ended inside a frame", c->name().c_str(), c->pid());
      }
      return false;
    }
    if (!c->decoder.feed(buf, static_cast<size_t>(n))) {
      RPC_LOGE("closing connection to %s from pid %d: malformed frame: %s", c->name().c_str(),
               c->pid(), c->decoder.error().c_str());
      return false;
    }
    Frame f;
    while (c->decoder.next(&f)) {
      if (f.kind == FrameKind::Call) {
        fresh->push_back(Task{c, std::move(f), {}});
        f = Frame();
      } else if (!c->deliverAnswer(std::move(f))) {
        RPC_LOGE("closing connection to %s from pid %d: answer to no call", c->name().c_str(),
                 c->pid());
        return false;
      }
    }
    return true;
  }

  // Ends `c` (readLock held): out of the set, its socket closed, its death
  // notices into *fresh.
  void closeConnLocked(const std::shared_ptr<ServerConn>& c, std::vector<Task>* fresh) {
    c->readClosed = true;
    {
      std::lock_guard<std::mutex> g(mLock);
      mConns.erase(c->id());
      if (mEpoll.get() >= 0) epoll_ctl(mEpoll.get(), EPOLL_CTL_DEL, c->fd(), nullptr);
    }
    for (auto& link : c->markClosed()) fresh->push_back(Task{nullptr, Frame(), std::move(link)});
  }

  std::mutex mLock;
  std::condition_variable mJoinCv;  // joiners leaving, readers done at shutdown
  std::deque<Task> mTasks;
  size_t mMaxThreads = 1;
  bool mCallerJoins = false;
  size_t mSpawned = 0;
  size_t mBusy = 0;
  size_t mWaiting = 0;   // pool threads in epoll_wait
  size_t mHandling = 0;  // threads reading a socket without the lock
  int mActiveJoiners = 0;
  bool mRunning = false;
  bool mStopping = false;
  std::vector<std::thread> mWorkers;
  std::vector<std::unique_ptr<Listener>> mListeners;
  std::map<uint64_t, std::shared_ptr<ServerConn>> mConns;
  uint64_t mNextConnId = 0;
  UniqueFd mEpoll;
  UniqueFd mStopFd;
  UniqueFd mWorkFd;
};

void readWhileWaiting(const std::shared_ptr<ServerConn>& conn, int wakeFd) {
  Host::get().readWhileWaiting(conn, wakeFd);
}

// ---------------------------------------------------------------------------
// Client side: one thread at a time drives the connection; the thread that
// waits for a reply also serves the calls that arrive meanwhile.

class ClientPeer : public RemotePeer, public std::enable_shared_from_this<ClientPeer> {
 public:
  explicit ClientPeer(UniqueFd fd) : mFd(std::move(fd)) {}
  ~ClientPeer() override {
    // Exported objects are released after the socket is gone.
    mExported.clear();
  }

  hardware::Status call(uint32_t object, uint32_t method, const BodyWriter& args,
                        std::vector<uint8_t>* reply) override {
    std::lock_guard<std::recursive_mutex> g(mIo);
    if (mDead) return transportError(mDeathReason);
    if (!args.ok()) return transportError("arguments exceed the frame limit");
    Frame f;
    f.kind = FrameKind::Call;
    if (++mNextId == 0) ++mNextId;
    f.id = mNextId;
    f.object = object;
    f.code = method;
    f.body = args.data();
    if (!sendFrame(mFd.get(), f, mTimeoutMs)) {
      die("cannot send to the service");
      return transportError(mDeathReason);
    }
    int64_t deadline = mTimeoutMs < 0 ? -1 : nowMs() + mTimeoutMs;
    mOutstanding.insert(f.id);
    for (;;) {
      auto it = mStashed.find(f.id);
      if (it != mStashed.end()) {
        Frame answer = std::move(it->second);
        mStashed.erase(it);
        mOutstanding.erase(f.id);
        return statusOfAnswer(answer, reply);
      }
      Frame in;
      int r = readFrame(&in, deadline);
      if (r == 0) die("no reply within " + std::to_string(mTimeoutMs) + " ms");
      if (r <= 0) {
        mOutstanding.erase(f.id);
        return transportError(mDeathReason);
      }
      if (in.kind == FrameKind::Call) {
        serveIncoming(in);
      } else if (mOutstanding.count(in.id) != 0) {
        mStashed[in.id] = std::move(in);
      } else {
        die("answer to no call from the service");
      }
    }
  }

  int pollIncoming(int timeoutMs) override {
    std::lock_guard<std::recursive_mutex> g(mIo);
    if (mDead) return -1;
    int served = 0;
    int64_t deadline = timeoutMs < 0 ? -1 : nowMs() + timeoutMs;
    for (;;) {
      Frame in;
      int r = readFrame(&in, served > 0 ? nowMs() : deadline);
      if (r == 0) return served;
      if (r < 0) return served > 0 ? served : -1;
      if (in.kind == FrameKind::Call) {
        serveIncoming(in);
        if (!mDead) ++served;
      } else if (mOutstanding.count(in.id) != 0) {
        mStashed[in.id] = std::move(in);
      } else {
        die("answer to no call from the service");
      }
    }
  }

  void setCallTimeout(int timeoutMs) override {
    std::lock_guard<std::recursive_mutex> g(mIo);
    mTimeoutMs = timeoutMs;
  }

  bool linkToDeath(const sp<hardware::hidl_death_recipient>& recipient, uint64_t cookie,
                   const wp<IBase>& who) override {
    std::lock_guard<std::recursive_mutex> g(mIo);
    if (mDead || recipient == nullptr) return false;
    mLinks.push_back({recipient, cookie, who});
    return true;
  }

  bool unlinkToDeath(const sp<hardware::hidl_death_recipient>& recipient,
                     const wp<IBase>& who) override {
    std::lock_guard<std::recursive_mutex> g(mIo);
    size_t before = mLinks.size();
    mLinks.erase(std::remove_if(mLinks.begin(), mLinks.end(),
                                [&](const DeathLink& l) {
                                  return l.recipient == recipient && l.who == who;
                                }),
                 mLinks.end());
    return mLinks.size() != before;
  }

  bool exportObject(const sp<IBase>& object, StubFn stub, uint32_t* id) override {
    std::lock_guard<std::recursive_mutex> g(mIo);
    for (auto& e : mExported) {
      if (e.second.object == object) {
        *id = e.first;
        return true;
      }
    }
    if (++mNextObject == 0) ++mNextObject;
    mExported[mNextObject] = {object, stub};
    *id = mNextObject;
    return true;
  }

  sp<IBase> importObject(uint32_t id, const ProxyFactory& make) override {
    return make(shared_from_this(), id);
  }

 private:
  struct Exported {
    sp<IBase> object;
    StubFn stub = nullptr;
  };

  // 1: a frame; 0: deadline passed; -1: the connection is gone.
  int readFrame(Frame* out, int64_t deadline) {
    uint8_t buf[8192];
    for (;;) {
      if (mDead) return -1;
      if (mDecoder.next(out)) return 1;
      pollfd pfd{mFd.get(), POLLIN, 0};
      int r = poll(&pfd, 1, remainingMs(deadline));
      if (r < 0 && errno == EINTR) continue;
      if (r < 0) {
        die(std::string("poll failed: ") + strerror(errno));
        return -1;
      }
      if (r == 0) return 0;
      ssize_t n = recv(mFd.get(), buf, sizeof(buf), MSG_DONTWAIT);
      if (n < 0 && (errno == EINTR || errno == EAGAIN || errno == EWOULDBLOCK)) continue;
      if (n <= 0) {
        die("connection to the service closed");
        return -1;
      }
      if (!mDecoder.feed(buf, static_cast<size_t>(n))) {
        die("malformed frame from the service: " + mDecoder.error());
        return -1;
      }
    }
  }

  void serveIncoming(const Frame& f) {
    Frame answer;
    auto it = mExported.find(f.object);
    if (it == mExported.end()) {
      answer = errorFrame(f.id, "no such object");
    } else {
      BodyReader in(f.body);
      BodyWriter out;
      std::string error;
      sp<IBase> target = it->second.object;
      StubResult r = it->second.stub(target, f.code, in, out, shared_from_this(), &error);
      if (r == StubResult::BadCall) {
        die("malformed call from the service: " + error);
        return;
      }
      if (r == StubResult::Replied) {
        answer.kind = FrameKind::Reply;
        answer.id = f.id;
        answer.body = out.take();
      } else {
        answer = errorFrame(f.id, error.empty() ? "call failed" : error);
      }
    }
    if (!sendFrame(mFd.get(), answer, kWriteStallMs)) die("cannot send to the service");
  }

  void die(const std::string& reason) {
    if (mDead) return;
    mDead = true;
    mDeathReason = reason;
    shutdown(mFd.get(), SHUT_RDWR);
    std::vector<DeathLink> links;
    links.swap(mLinks);
    // A client has no pool: its recipients hear of the death on the thread
    // that found it.
    for (auto& l : links) l.recipient->serviceDied(l.cookie, l.who);
  }

  UniqueFd mFd;
  std::recursive_mutex mIo;
  FrameDecoder mDecoder;
  bool mDead = false;
  std::string mDeathReason;
  int mTimeoutMs = -1;
  uint32_t mNextId = 0;
  uint32_t mNextObject = 0;
  std::set<uint32_t> mOutstanding;
  std::map<uint32_t, Frame> mStashed;
  std::map<uint32_t, Exported> mExported;
  std::vector<DeathLink> mLinks;
};

int connectTo(const std::string& path, std::string* error) {
  sockaddr_un addr;
  if (!fillAddress(path, &addr)) {
    if (error) *error = "socket path too long";
    return -1;
  }
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    if (error) *error = strerror(errno);
    return -1;
  }
  int r;
  do {
    r = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr));
  } while (r != 0 && errno == EINTR);
  if (r != 0) {
    if (error) *error = strerror(errno);
    close(fd);
    return -1;
  }
  return fd;
}

RemotePeer* peerOf(const sp<IBase>& object) {
  auto* proxy = dynamic_cast<ProxyBase*>(object.get());
  return proxy ? proxy->peer().get() : nullptr;
}

}  // namespace

status_t registerService(const std::string&, const std::string& name, const sp<IBase>& service,
                         StubFn stub) {
  return Host::get().add(serviceSocketDir(), name, service, stub);
}

status_t registerServiceIn(const std::string& dir, const std::string& name,
                           const sp<IBase>& service, StubFn stub) {
  return Host::get().add(dir, name, service, stub);
}

std::shared_ptr<RemotePeer> connectPath(const std::string& path, std::string* error) {
  int fd = connectTo(path, error);
  if (fd < 0) return nullptr;
  return std::make_shared<ClientPeer>(UniqueFd(fd));
}

std::shared_ptr<RemotePeer> connectService(const std::string& name, std::string* error) {
  if (!validServiceName(name)) {
    if (error) *error = "invalid instance name";
    return nullptr;
  }
  int fd = connectTo(serviceSocketPath(name), error);
  if (fd < 0) return nullptr;
  return std::make_shared<ClientPeer>(UniqueFd(fd));
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

int pollIncomingCalls(const sp<hidl::base::V1_0::IBase>& proxy, int timeoutMs) {
  rpc::RemotePeer* peer = rpc::peerOf(proxy);
  return peer ? peer->pollIncoming(timeoutMs) : -1;
}

bool setCallTimeout(const sp<hidl::base::V1_0::IBase>& proxy, int timeoutMs) {
  rpc::RemotePeer* peer = rpc::peerOf(proxy);
  if (peer == nullptr) return false;
  peer->setCallTimeout(timeoutMs);
  return true;
}

void shutdownRpcHostForTest() { rpc::Host::get().shutdownHost(); }

}  // namespace host

namespace hardware {

void configureRpcThreadpool(size_t maxThreads, bool callerWillJoin) {
  host::RpcHooks* hooks = host::rpc::currentHooks();
  if (hooks && hooks->configureThreadpool) {
    hooks->configureThreadpool(maxThreads, callerWillJoin);
    return;
  }
  host::rpc::Host::get().configure(maxThreads, callerWillJoin);
}

void joinRpcThreadpool() {
  host::RpcHooks* hooks = host::rpc::currentHooks();
  if (hooks && hooks->joinThreadpool) {
    hooks->joinThreadpool();
    return;
  }
  host::rpc::Host::get().join();
}

}  // namespace hardware
}  // namespace android

// The pool: idle threads wait together in one epoll set, read the socket
// whose event they took and run the call they read themselves.
#include "rpc_pool.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>

namespace android {
namespace host {
namespace rpc {

void Host::configure(size_t maxThreads, bool callerWillJoin) {
  std::lock_guard<std::mutex> g(mLock);
  mMaxThreads = maxThreads == 0 ? 1 : maxThreads;
  mCallerJoins = callerWillJoin;
  if (mRunning) spawnWorkersLocked();
}

void Host::join() {
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
// waits until it has more, `wakeFd` tells that a pool thread read it, or
// `deadline` comes. A connection with its most calls queued is not read
// here either; only its end is watched for.
void Host::readWhileWaiting(const std::shared_ptr<ServerConn>& c, int wakeFd, int64_t deadline) {
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
  if (poll(p, 2, remainingMs(deadline)) <= 0) return;
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

// Closes `c` as its client's end would: out of the set, its death notices
// queued for the pool.
void Host::drop(const std::shared_ptr<ServerConn>& c) {
  std::vector<Task> fresh;
  {
    std::lock_guard<std::mutex> rg(c->readLock);
    if (c->readClosed) return;
    closeConnLocked(c, &fresh);
  }
  queue(fresh);
}

void Host::shutdownHost() {
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

// Arms `fd` for one event.
bool Host::control(int op, int fd, uint64_t key, uint32_t events) {
  epoll_event ev{};
  ev.events = events;
  ev.data.u64 = key;
  return epoll_ctl(mEpoll.get(), op, fd, &ev) == 0;
}

bool Host::startLocked() {
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

void Host::spawnWorkersLocked() {
  size_t want = mCallerJoins ? mMaxThreads - 1 : mMaxThreads;
  while (mSpawned < want) {
    mWorkers.emplace_back([this] { workerLoop(); });
    ++mSpawned;
  }
}

// Pool threads and joiners: run what is queued, else wait for input.
void Host::workerLoop() {
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
void Host::run(Task& task, std::unique_lock<std::mutex>& lk) {
  if (lk.owns_lock()) lk.unlock();
  if (task.conn == nullptr) {
    if (task.death.recipient != nullptr) {
      CallerScope dead(task.deadPid, task.deadUid);
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
void Host::handle(const epoll_event& ev, std::unique_lock<std::mutex>& lk) {
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
void Host::armLocked(ServerConn& c) {
  if (mStopping || mConns.count(c.id()) == 0) return;
  if (c.inflight >= kMaxInflightPerConnection) {
    c.parked = true;
    return;
  }
  control(EPOLL_CTL_MOD, c.fd(), (c.id() << 2) | kConn, kConnEvents);
}

void Host::relock(std::unique_lock<std::mutex>& lk) {
  lk.lock();
  doneHandling();
}

void Host::doneHandling() {
  if (--mHandling == 0 && mStopping) mJoinCv.notify_all();
}

// Queues tasks read by a thread that cannot run them (it is in a call).
void Host::queue(std::vector<Task>& fresh) {
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
void Host::signalWork() {
  uint64_t one = 1;
  ssize_t unused = write(mWorkFd.get(), &one, sizeof(one));
  (void)unused;
}

// Reads what is there (readLock held); false when the connection is to
// be closed. Calls go to *fresh, answers to their waiting calls. Once the
// peer has stopped sending (`toEnd`), reads up to the end at once, so its
// end is seen in the same turn as its last bytes.
bool Host::readConn(const std::shared_ptr<ServerConn>& c, std::vector<Task>* fresh, bool toEnd) {
  for (int round = 0; round < kReadRoundsToEnd; ++round) {
    if (!readChunk(c, fresh)) return false;
    if (!toEnd) break;
  }
  return true;
}

// One recv's worth; false when the connection is to be closed.
bool Host::readChunk(const std::shared_ptr<ServerConn>& c, std::vector<Task>* fresh) {
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
void Host::closeConnLocked(const std::shared_ptr<ServerConn>& c, std::vector<Task>* fresh) {
  c->readClosed = true;
  {
    std::lock_guard<std::mutex> g(mLock);
    mConns.erase(c->id());
    if (mEpoll.get() >= 0) epoll_ctl(mEpoll.get(), EPOLL_CTL_DEL, c->fd(), nullptr);
  }
  for (auto& link : c->markClosed()) {
    fresh->push_back(Task{nullptr, Frame(), std::move(link), c->pid(), c->uid()});
  }
}

void readWhileWaiting(const std::shared_ptr<ServerConn>& conn, int wakeFd, int64_t deadline) {
  Host::get().readWhileWaiting(conn, wakeFd, deadline);
}

void dropConnection(const std::shared_ptr<ServerConn>& conn) { Host::get().drop(conn); }

}  // namespace rpc
}  // namespace host
}  // namespace android

#pragma once
// The server's side of one client connection: runs the calls read from it,
// makes calls to the client's callback objects and keeps its death links.
#include "rpc_caller.h"
#include "rpc_io.h"

#include <sys/eventfd.h>
#include <sys/socket.h>

#include <algorithm>
#include <iterator>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace android {
namespace host {
namespace rpc {

class ServerConn;
// A thread in a call to a client waits for the answer by reading the
// client's connection itself (defined with the pool, rpc_pool.cpp): the pool's
// threads may all be busy. Returns when there was something to read or
// `deadline` (nowMs) has come.
void readWhileWaiting(const std::shared_ptr<ServerConn>& conn, int wakeFd, int64_t deadline);
// Ends the connection as if its client had gone: its death notices run.
void dropConnection(const std::shared_ptr<ServerConn>& conn);

class ServerConn : public RemotePeer, public std::enable_shared_from_this<ServerConn> {
 public:
  ServerConn(UniqueFd fd, std::string name, sp<IBase> service, StubFn stub, pid_t pid,
             uid_t uid, uint64_t id)
      : mFd(std::move(fd)),
        mName(std::move(name)),
        mService(std::move(service)),
        mStub(stub),
        mPid(pid),
        mUid(uid),
        mId(id) {}

  int fd() const { return mFd.get(); }
  const std::string& name() const { return mName; }
  pid_t pid() const { return mPid; }
  uid_t uid() const { return mUid; }
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
    StubResult r;
    {
      CallerScope caller(mPid, mUid);
      r = mStub(service, f.code, in, out, shared_from_this(), &error);
    }
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

  // A call on the client's object. The client has callbackAnswerLimitMs()
  // to answer; past that it is dropped as dead, so that no client can keep
  // the calling thread (a pool thread, mostly) for longer.
  hardware::Status call(uint32_t object, uint32_t method, const BodyWriter& args,
                        std::vector<uint8_t>* reply) override {
    if (!args.ok()) return transportError("arguments exceed the frame limit");
    const int limitMs = callbackAnswerLimitMs();
    const int64_t deadline = nowMs() + limitMs;
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
    if (!send(f, std::min(limitMs, kWriteStallMs))) {
      abort();
      std::lock_guard<std::mutex> g(mLock);
      mPending.erase(f.id);
      return transportError("cannot send to client");
    }
    bool late = false;
    for (;;) {
      {
        std::lock_guard<std::mutex> g(mLock);
        if (pending->done || mClosed) {
          mPending.erase(f.id);
          break;
        }
        if (remainingMs(deadline) == 0) {
          mPending.erase(f.id);
          late = true;
          break;
        }
      }
      readWhileWaiting(shared_from_this(), wake.get(), deadline);
    }
    if (late) {
      RPC_LOGE("client pid %d of %s did not answer a callback within %d ms: dropped as dead",
               mPid, mName.c_str(), limitMs);
      dropConnection(shared_from_this());
      return transportError("client did not answer within " + std::to_string(limitMs) + " ms");
    }
    if (!pending->done) return transportError("client connection closed");
    return statusOfAnswer(pending->frame, reply);
  }

  bool linkToDeath(const sp<hardware::hidl_death_recipient>& recipient, uint64_t cookie,
                   const wp<IBase>& who, uint64_t whoSerial) override {
    if (recipient == nullptr) return false;
    std::lock_guard<std::mutex> g(mLock);
    if (mClosed) return false;
    mLinks.push_back({recipient, cookie, who, whoSerial});
    return true;
  }

  bool unlinkToDeath(const sp<hardware::hidl_death_recipient>& recipient,
                     uint64_t whoSerial) override {
    std::vector<DeathLink> removed;  // released outside the lock
    std::lock_guard<std::mutex> g(mLock);
    auto keep = std::stable_partition(mLinks.begin(), mLinks.end(), [&](const DeathLink& l) {
      return !(l.recipient == recipient && l.whoSerial == whoSerial);
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
    if (!mClosed) {
      // Proxies the daemon has let go of are forgotten, so that a client
      // passing ever new objects does not grow the table.
      for (auto p = mProxies.begin(); p != mProxies.end();) {
        p = p->second.promote() == nullptr ? mProxies.erase(p) : std::next(p);
      }
      mProxies[id] = proxy;
    }
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

  bool send(const Frame& f, int stallMs = kWriteStallMs) {
    std::lock_guard<std::mutex> g(mWriteLock);
    return mFd.get() >= 0 && sendFrame(mFd.get(), f, stallMs);
  }

  UniqueFd mFd;  // closed under readLock and mWriteLock
  const std::string mName;
  sp<IBase> mService;  // null once closed
  const StubFn mStub;
  const pid_t mPid;
  const uid_t mUid;
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
  pid_t deadPid = 0;  // the client whose death it tells
  uid_t deadUid = 0;
};

}  // namespace rpc
}  // namespace host
}  // namespace android

// The client connection: one thread at a time drives it, and the thread
// that waits for a reply also serves the calls that arrive meanwhile.
#include "rpc_io.h"

#include <host/rpc_host.h>

#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <vector>

namespace android {
namespace host {
namespace rpc {

namespace {

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
                   const wp<IBase>& who, uint64_t whoSerial) override {
    std::lock_guard<std::recursive_mutex> g(mIo);
    if (mDead || recipient == nullptr) return false;
    mLinks.push_back({recipient, cookie, who, whoSerial});
    return true;
  }

  bool unlinkToDeath(const sp<hardware::hidl_death_recipient>& recipient,
                     uint64_t whoSerial) override {
    std::lock_guard<std::recursive_mutex> g(mIo);
    size_t before = mLinks.size();
    mLinks.erase(std::remove_if(mLinks.begin(), mLinks.end(),
                                [&](const DeathLink& l) {
                                  return l.recipient == recipient && l.whoSerial == whoSerial;
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

RemotePeer* peerOf(const sp<IBase>& object) {
  auto* proxy = dynamic_cast<ProxyBase*>(object.get());
  return proxy ? proxy->peer().get() : nullptr;
}

}  // namespace

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

}  // namespace host
}  // namespace android

// Marshalling of the secure element interface over the RPC host: the stub
// that runs incoming calls on a registered ISecureElement, the client proxy
// returned by getService(), and both halves of ISecureElementHalCallback
// (exported by clients, called by the daemon through a proxy).
#include "rpc_internal.h"

#include <android/hardware/secure_element/1.0/ISecureElement.h>
#include <android/log.h>
#include <host/rpc_hooks.h>

#include <mutex>

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {

const char* ISecureElement::descriptor = "android.hardware.secure_element@1.0::ISecureElement";
const char* ISecureElementHalCallback::descriptor =
    "android.hardware.secure_element@1.0::ISecureElementHalCallback";

namespace {

using ::android::hidl::base::V1_0::IBase;
using ::android::host::rpc::BodyReader;
using ::android::host::rpc::BodyWriter;
using ::android::host::rpc::ProxyBase;
using ::android::host::rpc::RemotePeer;
using ::android::host::rpc::StubResult;
using ::android::host::rpc::transportError;

// Method numbers on the wire; part of the protocol, never renumbered.
enum SecureElementMethod : uint32_t {
  kInit = 1,
  kGetAtr = 2,
  kIsCardPresent = 3,
  kTransmit = 4,
  kOpenLogicalChannel = 5,
  kOpenBasicChannel = 6,
  kCloseChannel = 7,
  kPing = 8,
};

enum HalCallbackMethod : uint32_t {
  kOnStateChange = 1,
  kCallbackPing = 2,
};

constexpr uint8_t kLastStatus = static_cast<uint8_t>(SecureElementStatus::IOERROR);

StubResult badCall(std::string* error, const char* what) {
  *error = what;
  return StubResult::BadCall;
}

StubResult failed(std::string* error, const details::return_status& r) {
  *error = r.description();
  return StubResult::Failed;
}

Status badReply(const char* op) {
  return transportError(std::string("malformed reply to ") + op);
}

bool readStatus(BodyReader& r, SecureElementStatus* status) {
  uint8_t v;
  if (!r.u8(&v) || v > kLastStatus) return false;
  *status = static_cast<SecureElementStatus>(v);
  return true;
}

// The reply of a call whose result is only whether it ran.
StubResult doneOrFailed(const details::return_status& r, std::string* error) {
  return r.isOk() ? StubResult::Replied : failed(error, r);
}

// Both channel opens take an AID and P2 and nothing more.
BodyWriter openArgs(const hidl_vec<uint8_t>& aid, uint8_t p2) {
  BodyWriter args;
  args.bytes(aid);
  args.u8(p2);
  return args;
}

bool readOpenArgs(BodyReader& in, hidl_vec<uint8_t>* aid, uint8_t* p2) {
  return in.bytes(aid) && in.u8(p2) && in.finished();
}

// What every proxy of an interface `I` shares: remoteness, death links to
// the peer, and the call shapes whose reply carries nothing.
template <typename I>
class RemoteProxy : public I, public ProxyBase {
 public:
  using ProxyBase::ProxyBase;
  bool isRemote() const override { return true; }

  Return<bool> linkToDeath(const sp<hidl_death_recipient>& recipient, uint64_t cookie) override {
    return mPeer->linkToDeath(recipient, cookie, wp<IBase>(this), serial());
  }
  Return<bool> unlinkToDeath(const sp<hidl_death_recipient>& recipient) override {
    return mPeer->unlinkToDeath(recipient, serial());
  }

 protected:
  Status call(uint32_t method, const BodyWriter& args, std::vector<uint8_t>* reply) {
    return mPeer->call(mObject, method, args, reply);
  }

  // A call whose reply must be empty; anything in it is a malformed reply.
  Return<void> callExpectingEmpty(uint32_t method, const BodyWriter& args, const char* op) {
    std::vector<uint8_t> reply;
    Status st = call(method, args, &reply);
    if (!st.isOk()) return st;
    if (!reply.empty()) return badReply(op);
    return Void();
  }

  // A ping: only whether the peer answered counts.
  Return<void> callPing(uint32_t method) {
    std::vector<uint8_t> reply;
    Status st = call(method, BodyWriter(), &reply);
    if (!st.isOk()) return st;
    return Void();
  }
};

// Collects the result callback of one operation. The first result is kept;
// another call, or a call after the operation has returned, is logged and
// dropped, so a faulty implementation can neither corrupt the reply nor
// touch a finished call.
class ResultSlot {
 public:
  explicit ResultSlot(const char* op) : mState(std::make_shared<State>()), mOp(op) {}

  template <typename Fill>
  void set(Fill fill) const {
    std::lock_guard<std::mutex> g(mState->lock);
    if (mState->closed) {
      __android_log_print(ANDROID_LOG_ERROR, host::rpc::kLogTag,
                          "%s: result callback called after the call returned; dropped", mOp);
      return;
    }
    if (mState->called) {
      __android_log_print(ANDROID_LOG_ERROR, host::rpc::kLogTag,
                          "%s: result callback called again; keeping the first result", mOp);
      return;
    }
    mState->called = true;
    fill(mState->body);
  }

  // Ends the call: the reply body, or NoReply when no result was given.
  StubResult finish(const details::return_status& ret, BodyWriter& out, std::string* error) const {
    std::lock_guard<std::mutex> g(mState->lock);
    mState->closed = true;
    if (!ret.isOk()) return failed(error, ret);
    if (!mState->called) {
      *error = std::string(mOp) + " returned without a result";
      return StubResult::NoReply;
    }
    if (!mState->body.ok()) {
      *error = std::string(mOp) + " result exceeds the frame limit";
      return StubResult::Failed;
    }
    out = std::move(mState->body);
    return StubResult::Replied;
  }

 private:
  struct State {
    std::mutex lock;
    bool called = false;
    bool closed = false;
    BodyWriter body;
  };
  std::shared_ptr<State> mState;
  const char* mOp;
};

// Daemon side: the client's callback object.
class HalCallbackProxy : public RemoteProxy<ISecureElementHalCallback> {
 public:
  using RemoteProxy::RemoteProxy;

  Return<void> onStateChange(bool connected) override {
    BodyWriter args;
    args.u8(connected ? 1 : 0);
    return callExpectingEmpty(kOnStateChange, args, "onStateChange");
  }

  Return<void> ping() override { return callPing(kCallbackPing); }
};

sp<IBase> makeCallbackProxy(const std::shared_ptr<RemotePeer>& peer, uint32_t id) {
  return sp<IBase>(new HalCallbackProxy(peer, id));
}

// Client side: runs the daemon's calls on the client's callback object.
StubResult callbackStub(const sp<IBase>& target, uint32_t method, BodyReader& in, BodyWriter&,
                        const std::shared_ptr<RemotePeer>&, std::string* error) {
  auto* cb = static_cast<ISecureElementHalCallback*>(target.get());
  switch (method) {
    case kOnStateChange: {
      bool connected;
      if (!in.boolean(&connected) || !in.finished()) return badCall(error, "onStateChange arguments");
      return doneOrFailed(cb->onStateChange(connected), error);
    }
    case kCallbackPing: {
      if (!in.finished()) return badCall(error, "ping arguments");
      return doneOrFailed(cb->ping(), error);
    }
    default:
      return badCall(error, "unknown callback method");
  }
}

// Daemon side: runs a client's call on the registered instance.
StubResult secureElementStub(const sp<IBase>& target, uint32_t method, BodyReader& in,
                             BodyWriter& out, const std::shared_ptr<RemotePeer>& peer,
                             std::string* error) {
  auto* se = static_cast<ISecureElement*>(target.get());
  switch (method) {
    case kInit: {
      uint32_t id;
      if (!in.u32(&id) || !in.finished()) return badCall(error, "init arguments");
      sp<ISecureElementHalCallback> cb;
      if (id != 0) {
        sp<IBase> proxy = peer->importObject(id, makeCallbackProxy);
        cb = static_cast<ISecureElementHalCallback*>(proxy.get());
      }
      return doneOrFailed(se->init(cb), error);
    }
    case kGetAtr: {
      if (!in.finished()) return badCall(error, "getAtr arguments");
      ResultSlot slot("getAtr");
      Return<void> r = se->getAtr([slot](const hidl_vec<uint8_t>& atr) {
        slot.set([&](BodyWriter& w) { w.bytes(atr); });
      });
      return slot.finish(r, out, error);
    }
    case kIsCardPresent: {
      if (!in.finished()) return badCall(error, "isCardPresent arguments");
      Return<bool> r = se->isCardPresent();
      if (!r.isOk()) return failed(error, r);
      out.u8(static_cast<bool>(r) ? 1 : 0);
      return StubResult::Replied;
    }
    case kTransmit: {
      hidl_vec<uint8_t> data;
      if (!in.bytes(&data) || !in.finished()) return badCall(error, "transmit arguments");
      ResultSlot slot("transmit");
      Return<void> r = se->transmit(data, [slot](const hidl_vec<uint8_t>& response) {
        slot.set([&](BodyWriter& w) { w.bytes(response); });
      });
      return slot.finish(r, out, error);
    }
    case kOpenLogicalChannel: {
      hidl_vec<uint8_t> aid;
      uint8_t p2;
      if (!readOpenArgs(in, &aid, &p2)) return badCall(error, "openLogicalChannel arguments");
      ResultSlot slot("openLogicalChannel");
      Return<void> r = se->openLogicalChannel(
          aid, p2, [slot](const LogicalChannelResponse& resp, SecureElementStatus status) {
            slot.set([&](BodyWriter& w) {
              w.u8(resp.channelNumber);
              w.bytes(resp.selectResponse);
              w.u8(static_cast<uint8_t>(status));
            });
          });
      return slot.finish(r, out, error);
    }
    case kOpenBasicChannel: {
      hidl_vec<uint8_t> aid;
      uint8_t p2;
      if (!readOpenArgs(in, &aid, &p2)) return badCall(error, "openBasicChannel arguments");
      ResultSlot slot("openBasicChannel");
      Return<void> r = se->openBasicChannel(
          aid, p2, [slot](const hidl_vec<uint8_t>& selectResponse, SecureElementStatus status) {
            slot.set([&](BodyWriter& w) {
              w.bytes(selectResponse);
              w.u8(static_cast<uint8_t>(status));
            });
          });
      return slot.finish(r, out, error);
    }
    case kCloseChannel: {
      uint8_t channel;
      if (!in.u8(&channel) || !in.finished()) return badCall(error, "closeChannel arguments");
      Return<SecureElementStatus> r = se->closeChannel(channel);
      if (!r.isOk()) return failed(error, r);
      out.u8(static_cast<uint8_t>(static_cast<SecureElementStatus>(r)));
      return StubResult::Replied;
    }
    case kPing: {
      if (!in.finished()) return badCall(error, "ping arguments");
      return doneOrFailed(se->ping(), error);
    }
    default:
      return badCall(error, "unknown method");
  }
}

// Client side: the registered instance.
class SecureElementProxy : public RemoteProxy<ISecureElement> {
 public:
  using RemoteProxy::RemoteProxy;

  Return<void> init(const sp<ISecureElementHalCallback>& clientCallback) override {
    uint32_t id = 0;
    if (clientCallback != nullptr) {
      if (clientCallback->isRemote()) return transportError("a proxy cannot be passed on");
      if (!mPeer->exportObject(clientCallback, callbackStub, &id)) {
        return transportError("cannot export the callback");
      }
    }
    BodyWriter args;
    args.u32(id);
    return callExpectingEmpty(kInit, args, "init");
  }

  Return<void> getAtr(getAtr_cb _hidl_cb) override {
    std::vector<uint8_t> reply;
    Status st = call(kGetAtr, BodyWriter(), &reply);
    if (!st.isOk()) return st;
    BodyReader r(reply);
    hidl_vec<uint8_t> atr;
    if (!r.bytes(&atr) || !r.finished()) return badReply("getAtr");
    _hidl_cb(atr);
    return Void();
  }

  Return<bool> isCardPresent() override {
    std::vector<uint8_t> reply;
    Status st = call(kIsCardPresent, BodyWriter(), &reply);
    if (!st.isOk()) return st;
    BodyReader r(reply);
    bool present;
    if (!r.boolean(&present) || !r.finished()) return badReply("isCardPresent");
    return present;
  }

  Return<void> transmit(const hidl_vec<uint8_t>& data, transmit_cb _hidl_cb) override {
    BodyWriter args;
    args.bytes(data);
    std::vector<uint8_t> reply;
    Status st = call(kTransmit, args, &reply);
    if (!st.isOk()) return st;
    BodyReader r(reply);
    hidl_vec<uint8_t> response;
    if (!r.bytes(&response) || !r.finished()) return badReply("transmit");
    _hidl_cb(response);
    return Void();
  }

  Return<void> openLogicalChannel(const hidl_vec<uint8_t>& aid, uint8_t p2,
                                  openLogicalChannel_cb _hidl_cb) override {
    BodyWriter args = openArgs(aid, p2);
    std::vector<uint8_t> reply;
    Status st = call(kOpenLogicalChannel, args, &reply);
    if (!st.isOk()) return st;
    BodyReader r(reply);
    LogicalChannelResponse resp;
    SecureElementStatus status;
    if (!r.u8(&resp.channelNumber) || !r.bytes(&resp.selectResponse) || !readStatus(r, &status) ||
        !r.finished()) {
      return badReply("openLogicalChannel");
    }
    _hidl_cb(resp, status);
    return Void();
  }

  Return<void> openBasicChannel(const hidl_vec<uint8_t>& aid, uint8_t p2,
                                openBasicChannel_cb _hidl_cb) override {
    BodyWriter args = openArgs(aid, p2);
    std::vector<uint8_t> reply;
    Status st = call(kOpenBasicChannel, args, &reply);
    if (!st.isOk()) return st;
    BodyReader r(reply);
    hidl_vec<uint8_t> selectResponse;
    SecureElementStatus status;
    if (!r.bytes(&selectResponse) || !readStatus(r, &status) || !r.finished()) {
      return badReply("openBasicChannel");
    }
    _hidl_cb(selectResponse, status);
    return Void();
  }

  Return<SecureElementStatus> closeChannel(uint8_t channelNumber) override {
    BodyWriter args;
    args.u8(channelNumber);
    std::vector<uint8_t> reply;
    Status st = call(kCloseChannel, args, &reply);
    if (!st.isOk()) return st;
    BodyReader r(reply);
    SecureElementStatus status;
    if (!readStatus(r, &status) || !r.finished()) return badReply("closeChannel");
    return status;
  }

  Return<void> ping() override { return callPing(kPing); }
};

}  // namespace

sp<ISecureElement> ISecureElement::getService(const std::string& serviceName, bool) {
  std::string error;
  std::shared_ptr<RemotePeer> peer = host::rpc::connectService(serviceName, &error);
  if (peer == nullptr) return nullptr;
  return sp<ISecureElement>(new SecureElementProxy(std::move(peer), 0));
}

status_t ISecureElement::registerAsService(const std::string& serviceName) {
  sp<IBase> self(this);
  host::RpcHooks* hooks = host::rpc::currentHooks();
  if (hooks && hooks->registerService) {
    return hooks->registerService(descriptor, serviceName, self);
  }
  return host::rpc::registerService(descriptor, serviceName, self, secureElementStub);
}

}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

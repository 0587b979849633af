// Marshalling of the AIDL secure element interface over the RPC host: the
// transact functions that run incoming calls on local ISecureElement and
// ISecureElementCallback objects, and their proxies. Every reply starts with
// the callee's status; results follow only when it is OK.
#include <aidl/android/hardware/secure_element/BnSecureElement.h>
#include <aidl/android/hardware/secure_element/BnSecureElementCallback.h>
#include <aidl/android/hardware/secure_element/BpSecureElement.h>
#include <aidl/android/hardware/secure_element/BpSecureElementCallback.h>

#include "aidl_binder.h"

namespace aidl {
namespace android {
namespace hardware {
namespace secure_element {

const char* ISecureElement::descriptor = "android.hardware.secure_element.ISecureElement";
const char* ISecureElementCallback::descriptor =
    "android.hardware.secure_element.ISecureElementCallback";

namespace {

using ::android::host::aidl_rpc::BodyReader;
using ::android::host::aidl_rpc::BodyWriter;
using ::android::host::aidl_rpc::callRemote;
using ::android::host::aidl_rpc::RemotePeer;
using ::android::host::aidl_rpc::StubResult;
using ::android::host::aidl_rpc::writeStatus;
using ::ndk::ScopedAStatus;

// Transaction codes, in the order the interfaces declare their methods.
enum : uint32_t {
  kCloseChannel = 1,
  kGetAtr = 2,
  kInit = 3,
  kIsCardPresent = 4,
  kOpenBasicChannel = 5,
  kOpenLogicalChannel = 6,
  kReset = 7,
  kTransmit = 8,
  kGetInterfaceVersion = 0xfffffe,
};
enum : uint32_t { kOnStateChange = 1 };

constexpr size_t kMaxReason = 1024;

StubResult badCall(std::string* error, const char* what) {
  *error = what;
  return StubResult::BadCall;
}

ScopedAStatus badReply(const char* op) {
  return ScopedAStatus::fromExceptionCodeWithMessage(
      EX_TRANSACTION_FAILED, (std::string("malformed reply to ") + op).c_str());
}

std::vector<uint8_t> toVector(const ::android::hardware::hidl_vec<uint8_t>& v) {
  return std::vector<uint8_t>(v.begin(), v.end());
}

bool readBytes(BodyReader& r, std::vector<uint8_t>* out) {
  ::android::hardware::hidl_vec<uint8_t> v;
  if (!r.bytes(&v)) return false;
  *out = toVector(v);
  return true;
}

bool readByte(BodyReader& r, int8_t* out) {
  uint8_t v;
  if (!r.u8(&v)) return false;
  *out = static_cast<int8_t>(v);
  return true;
}

// The status, then (when OK) what `results` writes.
template <typename Fill>
StubResult reply(BodyWriter& out, const ScopedAStatus& st, Fill results, std::string* error) {
  writeStatus(out, st);
  if (st.isOk()) results(out);
  if (!out.ok()) {
    *error = "reply exceeds the frame limit";
    return StubResult::Failed;
  }
  return StubResult::Replied;
}

StubResult replyStatus(BodyWriter& out, const ScopedAStatus& st, std::string* error) {
  return reply(out, st, [](BodyWriter&) {}, error);
}

StubResult secureElementTransact(::ndk::ICInterface* target, uint32_t code, BodyReader& in,
                                 BodyWriter& out, const std::shared_ptr<RemotePeer>& peer,
                                 std::string* error) {
  auto* se = static_cast<ISecureElement*>(target);
  switch (code) {
    case kCloseChannel: {
      int8_t channel;
      if (!readByte(in, &channel) || !in.finished()) return badCall(error, "closeChannel arguments");
      return replyStatus(out, se->closeChannel(channel), error);
    }
    case kGetAtr: {
      if (!in.finished()) return badCall(error, "getAtr arguments");
      std::vector<uint8_t> atr;
      ScopedAStatus st = se->getAtr(&atr);
      return reply(out, st, [&](BodyWriter& w) { w.bytes(atr.data(), atr.size()); }, error);
    }
    case kInit: {
      uint32_t id;
      if (!in.u32(&id) || !in.finished()) return badCall(error, "init arguments");
      std::shared_ptr<ISecureElementCallback> cb =
          ISecureElementCallback::fromBinder(::android::host::aidl_rpc::readBinder(id, peer));
      if (id != 0 && cb == nullptr) return badCall(error, "init callback is no callback");
      return replyStatus(out, se->init(cb), error);
    }
    case kIsCardPresent: {
      if (!in.finished()) return badCall(error, "isCardPresent arguments");
      bool present = false;
      ScopedAStatus st = se->isCardPresent(&present);
      return reply(out, st, [&](BodyWriter& w) { w.u8(present ? 1 : 0); }, error);
    }
    case kOpenBasicChannel:
    case kOpenLogicalChannel: {
      std::vector<uint8_t> aid;
      int8_t p2;
      if (!readBytes(in, &aid) || !readByte(in, &p2) || !in.finished()) {
        return badCall(error, "open arguments");
      }
      if (code == kOpenBasicChannel) {
        std::vector<uint8_t> select;
        ScopedAStatus st = se->openBasicChannel(aid, p2, &select);
        return reply(out, st, [&](BodyWriter& w) { w.bytes(select.data(), select.size()); },
                     error);
      }
      LogicalChannelResponse resp;
      ScopedAStatus st = se->openLogicalChannel(aid, p2, &resp);
      return reply(out, st,
                   [&](BodyWriter& w) {
                     w.bytes(resp.selectResponse.data(), resp.selectResponse.size());
                     w.u8(static_cast<uint8_t>(resp.channelNumber));
                   },
                   error);
    }
    case kReset: {
      if (!in.finished()) return badCall(error, "reset arguments");
      return replyStatus(out, se->reset(), error);
    }
    case kTransmit: {
      std::vector<uint8_t> data;
      if (!readBytes(in, &data) || !in.finished()) return badCall(error, "transmit arguments");
      std::vector<uint8_t> response;
      ScopedAStatus st = se->transmit(data, &response);
      return reply(out, st, [&](BodyWriter& w) { w.bytes(response.data(), response.size()); },
                   error);
    }
    case kGetInterfaceVersion: {
      if (!in.finished()) return badCall(error, "getInterfaceVersion arguments");
      int32_t v = 0;
      ScopedAStatus st = se->getInterfaceVersion(&v);
      return reply(out, st, [&](BodyWriter& w) { w.u32(static_cast<uint32_t>(v)); }, error);
    }
    default:
      return badCall(error, "unknown method");
  }
}

StubResult callbackTransact(::ndk::ICInterface* target, uint32_t code, BodyReader& in,
                            BodyWriter& out, const std::shared_ptr<RemotePeer>&,
                            std::string* error) {
  auto* cb = static_cast<ISecureElementCallback*>(target);
  switch (code) {
    case kOnStateChange: {
      bool connected;
      std::string reason;
      if (!in.boolean(&connected) || !in.text(&reason, kMaxReason) || !in.finished()) {
        return badCall(error, "onStateChange arguments");
      }
      return replyStatus(out, cb->onStateChange(connected, reason), error);
    }
    case kGetInterfaceVersion: {
      if (!in.finished()) return badCall(error, "getInterfaceVersion arguments");
      int32_t v = 0;
      ScopedAStatus st = cb->getInterfaceVersion(&v);
      return reply(out, st, [&](BodyWriter& w) { w.u32(static_cast<uint32_t>(v)); }, error);
    }
    default:
      return badCall(error, "unknown callback method");
  }
}

// A call whose reply carries nothing but the status.
ScopedAStatus callForStatus(AIBinder* b, uint32_t code, const BodyWriter& args, const char* op) {
  std::vector<uint8_t> results;
  ScopedAStatus st = callRemote(b, code, args, &results);
  if (st.isOk() && !results.empty()) return badReply(op);
  return st;
}

// A call whose reply carries one byte string.
ScopedAStatus callForBytes(AIBinder* b, uint32_t code, const BodyWriter& args, const char* op,
                           std::vector<uint8_t>* out) {
  std::vector<uint8_t> results;
  ScopedAStatus st = callRemote(b, code, args, &results);
  if (!st.isOk()) return st;
  BodyReader r(results);
  if (!readBytes(r, out) || !r.finished()) return badReply(op);
  return st;
}

ScopedAStatus callForVersion(AIBinder* b, int32_t* out) {
  std::vector<uint8_t> results;
  ScopedAStatus st = callRemote(b, kGetInterfaceVersion, BodyWriter(), &results);
  if (!st.isOk()) return st;
  BodyReader r(results);
  uint32_t v;
  if (!r.u32(&v) || !r.finished()) return badReply("getInterfaceVersion");
  *out = static_cast<int32_t>(v);
  return st;
}

BodyWriter openArgs(const std::vector<uint8_t>& aid, int8_t p2) {
  BodyWriter args;
  args.bytes(aid.data(), aid.size());
  args.u8(static_cast<uint8_t>(p2));
  return args;
}

}  // namespace

::ndk::SpAIBinder BnSecureElement::createBinder() {
  return ::android::host::aidl_rpc::newLocalBinder(ref<::ndk::ICInterface>(), descriptor,
                                                   secureElementTransact);
}

::ndk::SpAIBinder BnSecureElementCallback::createBinder() {
  return ::android::host::aidl_rpc::newLocalBinder(ref<::ndk::ICInterface>(), descriptor,
                                                   callbackTransact);
}

std::shared_ptr<ISecureElement> ISecureElement::fromBinder(const ::ndk::SpAIBinder& binder) {
  if (binder.get() == nullptr) return nullptr;
  if (!AIBinder_isRemote(binder.get())) {
    return std::static_pointer_cast<ISecureElement>(
        ::android::host::aidl_rpc::localObject(binder, descriptor));
  }
  return ::ndk::SharedRefBase::make<BpSecureElement>(binder);
}

std::shared_ptr<ISecureElementCallback> ISecureElementCallback::fromBinder(
    const ::ndk::SpAIBinder& binder) {
  if (binder.get() == nullptr) return nullptr;
  if (!AIBinder_isRemote(binder.get())) {
    return std::static_pointer_cast<ISecureElementCallback>(
        ::android::host::aidl_rpc::localObject(binder, descriptor));
  }
  return ::ndk::SharedRefBase::make<BpSecureElementCallback>(binder);
}

ScopedAStatus BpSecureElement::closeChannel(int8_t in_channelNumber) {
  BodyWriter args;
  args.u8(static_cast<uint8_t>(in_channelNumber));
  return callForStatus(asBinder().get(), kCloseChannel, args, "closeChannel");
}

ScopedAStatus BpSecureElement::getAtr(std::vector<uint8_t>* _aidl_return) {
  return callForBytes(asBinder().get(), kGetAtr, BodyWriter(), "getAtr", _aidl_return);
}

ScopedAStatus BpSecureElement::init(
    const std::shared_ptr<ISecureElementCallback>& in_clientCallback) {
  ::ndk::SpAIBinder self = asBinder();
  BodyWriter args;
  std::string error;
  ::ndk::SpAIBinder cb = in_clientCallback ? in_clientCallback->asBinder() : ::ndk::SpAIBinder();
  if (!::android::host::aidl_rpc::writeBinder(self.get(), cb, args, &error)) {
    return ScopedAStatus::fromExceptionCodeWithMessage(EX_ILLEGAL_ARGUMENT, error.c_str());
  }
  return callForStatus(self.get(), kInit, args, "init");
}

ScopedAStatus BpSecureElement::isCardPresent(bool* _aidl_return) {
  std::vector<uint8_t> results;
  ScopedAStatus st = callRemote(asBinder().get(), kIsCardPresent, BodyWriter(), &results);
  if (!st.isOk()) return st;
  BodyReader r(results);
  if (!r.boolean(_aidl_return) || !r.finished()) return badReply("isCardPresent");
  return st;
}

ScopedAStatus BpSecureElement::openBasicChannel(const std::vector<uint8_t>& in_aid, int8_t in_p2,
                                                std::vector<uint8_t>* _aidl_return) {
  return callForBytes(asBinder().get(), kOpenBasicChannel, openArgs(in_aid, in_p2),
                      "openBasicChannel", _aidl_return);
}

ScopedAStatus BpSecureElement::openLogicalChannel(const std::vector<uint8_t>& in_aid,
                                                  int8_t in_p2,
                                                  LogicalChannelResponse* _aidl_return) {
  std::vector<uint8_t> results;
  ScopedAStatus st =
      callRemote(asBinder().get(), kOpenLogicalChannel, openArgs(in_aid, in_p2), &results);
  if (!st.isOk()) return st;
  BodyReader r(results);
  if (!readBytes(r, &_aidl_return->selectResponse) ||
      !readByte(r, &_aidl_return->channelNumber) || !r.finished()) {
    return badReply("openLogicalChannel");
  }
  return st;
}

ScopedAStatus BpSecureElement::reset() {
  return callForStatus(asBinder().get(), kReset, BodyWriter(), "reset");
}

ScopedAStatus BpSecureElement::transmit(const std::vector<uint8_t>& in_data,
                                        std::vector<uint8_t>* _aidl_return) {
  BodyWriter args;
  args.bytes(in_data.data(), in_data.size());
  return callForBytes(asBinder().get(), kTransmit, args, "transmit", _aidl_return);
}

ScopedAStatus BpSecureElement::getInterfaceVersion(int32_t* _aidl_return) {
  return callForVersion(asBinder().get(), _aidl_return);
}

ScopedAStatus BpSecureElementCallback::onStateChange(bool in_connected,
                                                     const std::string& in_debugReason) {
  BodyWriter args;
  args.u8(in_connected ? 1 : 0);
  args.text(in_debugReason.size() > kMaxReason ? in_debugReason.substr(0, kMaxReason)
                                               : in_debugReason);
  return callForStatus(asBinder().get(), kOnStateChange, args, "onStateChange");
}

ScopedAStatus BpSecureElementCallback::getInterfaceVersion(int32_t* _aidl_return) {
  return callForVersion(asBinder().get(), _aidl_return);
}

}  // namespace secure_element
}  // namespace hardware
}  // namespace android
}  // namespace aidl

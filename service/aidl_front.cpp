#include "aidl_front.h"

#include <android/log.h>

#include <errno.h>
#include <signal.h>

#include <cstdio>

#include "se_device_gate.h"

namespace aidl {
namespace android {
namespace hardware {
namespace secure_element {

namespace {

using ::android::sp;
using ::android::wp;
using ::android::hardware::hidl_death_recipient;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::Void;
using ::android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using ::android::hardware::secure_element::V1_0::SecureElementStatus;
using ::android::hidl::base::V1_0::IBase;
using ::ndk::ScopedAStatus;
using HidlChannelResponse = ::android::hardware::secure_element::V1_0::LogicalChannelResponse;

constexpr const char* kTag = "qvese-aidl";
constexpr uint8_t kMaxLogicalChannel = 19;

#define AIDL_LOGE(...) __android_log_print(ANDROID_LOG_ERROR, kTag, __VA_ARGS__)
#define AIDL_LOGI(...) __android_log_print(ANDROID_LOG_INFO, kTag, __VA_ARGS__)

ScopedAStatus error(int32_t code, const std::string& message) {
  return ScopedAStatus::fromServiceSpecificErrorWithMessage(code, message.c_str());
}

// A HIDL status other than SUCCESS as the AIDL error with the same number.
ScopedAStatus errorOf(SecureElementStatus status, const std::string& message) {
  return error(static_cast<int32_t>(status), message);
}

// The logical channel a command's CLA names: 0-3 in a first interindustry
// class, 4-19 in a further one; -1 for the invalid CLA FF.
int channelOfCla(uint8_t cla) {
  if (cla == 0xFF) return -1;
  return (cla & 0x40) ? 4 + (cla & 0x0F) : (cla & 0x03);
}

// Stands for the AIDL client as the HIDL front's callback: readiness goes to
// the client with a reason, the death link to the client's binder. One per
// init or reset, so each knows whether its own bring-up reported ready.
class HalCallbackBridge : public ISecureElementHalCallback {
 public:
  HalCallbackBridge(AidlFront* front, std::shared_ptr<ISecureElementCallback> cb,
                    std::string name)
      : mFront(front), mCallback(std::move(cb)), mName(std::move(name)) {}

  Return<void> onStateChange(bool connected) override {
    if (connected) mReady = true;
    ScopedAStatus st = mCallback->onStateChange(
        connected, mName + (connected ? " is ready" : " is not connected"));
    if (!st.isOk()) AIDL_LOGE("%s, onStateChange: %s", mName.c_str(), st.getDescription().c_str());
    return Void();
  }

  Return<bool> linkToDeath(const sp<hidl_death_recipient>& recipient, uint64_t cookie) override {
    return mFront->linkClient(mCallback->asBinder().get(), recipient, cookie, wp<IBase>(this));
  }

  bool ready() const { return mReady; }

 private:
  AidlFront* const mFront;
  const std::shared_ptr<ISecureElementCallback> mCallback;
  const std::string mName;
  std::atomic<bool> mReady{false};
};

}  // namespace

AidlFront::AidlFront(sp<HidlSecureElement> hidl, std::string name, Element element)
    : mHidl(std::move(hidl)),
      mName(std::move(name)),
      mElement(std::move(element)),
      mDeath(AIBinder_DeathRecipient_new(&AidlFront::onClientDied)) {}

AidlFront::~AidlFront() {
  // No death notice may reach this object once it is gone.
  mDeath.set(nullptr);
}

bool AidlFront::linkClient(AIBinder* client, const sp<hidl_death_recipient>& recipient,
                           uint64_t cookie, const wp<IBase>& who) {
  if (client == nullptr || recipient == nullptr) return false;
  std::lock_guard<std::mutex> g(mLock);
  for (const auto& l : mLinks) {
    // Each init of the same client links again; one notice is enough.
    if (l->client.get() == client && l->recipient == recipient) return true;
  }
  AIBinder_incStrong(client);
  auto link = std::make_unique<ClientLink>(
      ClientLink{this, ::ndk::SpAIBinder(client), se_call::callerPid(), recipient, cookie, who});
  if (AIBinder_linkToDeath(client, mDeath.get(), link.get()) != STATUS_OK) return false;
  mLinks.push_back(std::move(link));
  return true;
}

void AidlFront::onClientDied(void* cookie) {
  auto* link = static_cast<ClientLink*>(cookie);
  link->front->clientDied(link);
}

void AidlFront::clientDied(ClientLink* link) {
  sp<hidl_death_recipient> recipient;
  uint64_t cookie = 0;
  wp<IBase> who;
  std::unique_ptr<ClientLink> gone;
  pid_t pid = 0;
  {
    std::lock_guard<std::mutex> g(mLock);
    for (auto it = mLinks.begin(); it != mLinks.end(); ++it) {
      if (it->get() != link) continue;
      recipient = link->recipient;
      cookie = link->cookie;
      who = link->who;
      mCallbacks.erase(link->pid);
      // The basic channel was that client's; the card forgets it with the
      // element's close that the HIDL front does on a client's death.
      pid = link->pid;
      pid_t owner = pid;
      mBasicOwner.compare_exchange_strong(owner, 0);
      gone = std::move(*it);
      mLinks.erase(it);
      break;
    }
  }
  AIDL_LOGI("%s, client %d died", mName.c_str(), static_cast<int>(pid));
  if (recipient != nullptr) recipient->serviceDied(cookie, who);
}

bool AidlFront::bringUp(const std::shared_ptr<ISecureElementCallback>& cb) {
  sp<HalCallbackBridge> bridge = new HalCallbackBridge(this, cb, mName);
  Return<void> r = mHidl->init(bridge);
  return r.isOk() && bridge->ready();
}

pid_t AidlFront::basicOwner() {
  pid_t owner = mBasicOwner.load();
  if (owner != 0 && kill(owner, 0) != 0 && errno == ESRCH) {
    // Its client went without a death link (it never called init).
    AIDL_LOGI("%s, the basic channel's client %d is gone", mName.c_str(), static_cast<int>(owner));
    mHidl->closeChannel(0);
    mBasicOwner.compare_exchange_strong(owner, 0);
  }
  return mBasicOwner.load();
}

bool AidlFront::channelOpen(uint8_t channel, pid_t caller) {
  if (channel == 0) return mBasicOwner.load() == caller;
  return channel <= kMaxLogicalChannel && mElement.logicalChannelOpen(channel);
}

// Each call runs as its client: admitted once to the instance (the HIDL
// calls it makes count with it), the client's process named for channel
// ownership, and the HIDL front's failures read back.
#define AIDL_CALL(op)                                                            \
  se_call::Scope callScope(AIBinder_getCallingPid());                             \
  std::unique_ptr<DeviceGate::Pass> admission;                                  \
  if (mElement.gate != nullptr) {                                               \
    admission = std::make_unique<DeviceGate::Pass>(mElement.gate->admit(op));   \
    if (!admission->ok()) return error(FAILED, mName + " is busy: " op " refused"); \
  }

ScopedAStatus AidlFront::init(const std::shared_ptr<ISecureElementCallback>& in_clientCallback) {
  if (in_clientCallback == nullptr) {
    // The HIDL front logs the null callback and does nothing else.
    mHidl->init(nullptr);
    return ScopedAStatus::fromExceptionCodeWithMessage(EX_NULL_POINTER, "init needs a callback");
  }
  AIDL_CALL("init");
  {
    std::lock_guard<std::mutex> g(mLock);
    mCallbacks[se_call::callerPid()] = in_clientCallback;
  }
  if (!bringUp(in_clientCallback)) {
    AIDL_LOGE("%s, init: the element did not come up", mName.c_str());
    return error(IOERROR, mName + " did not come up");
  }
  return ScopedAStatus::ok();
}

ScopedAStatus AidlFront::getAtr(std::vector<uint8_t>* _aidl_return) {
  AIDL_CALL("getAtr");
  bool called = false;
  Return<void> r = mHidl->getAtr([&](const hidl_vec<uint8_t>& atr) {
    *_aidl_return = atr;
    called = true;
  });
  if (!r.isOk() || !called || se_call::failed()) {
    _aidl_return->clear();
    return error(FAILED, "getAtr failed");
  }
  return ScopedAStatus::ok();
}

ScopedAStatus AidlFront::isCardPresent(bool* _aidl_return) {
  AIDL_CALL("isCardPresent");
  Return<bool> r = mHidl->isCardPresent();
  if (!r.isOk() || se_call::failed()) return error(FAILED, "isCardPresent failed");
  *_aidl_return = r;
  return ScopedAStatus::ok();
}

ScopedAStatus AidlFront::openLogicalChannel(const std::vector<uint8_t>& in_aid, int8_t in_p2,
                                            LogicalChannelResponse* _aidl_return) {
  AIDL_CALL("openLogicalChannel");
  bool called = false;
  HidlChannelResponse resp;
  SecureElementStatus status = SecureElementStatus::FAILED;
  Return<void> r = mHidl->openLogicalChannel(
      in_aid, static_cast<uint8_t>(in_p2),
      [&](const HidlChannelResponse& rsp, SecureElementStatus st) {
        resp = rsp;
        status = st;
        called = true;
      });
  if (!r.isOk() || !called) return error(FAILED, "openLogicalChannel gave no result");
  if (status != SecureElementStatus::SUCCESS) {
    return errorOf(status, "openLogicalChannel: " + toString(status));
  }
  const uint8_t channel = resp.channelNumber;
  if (channel < 1 || channel > kMaxLogicalChannel || resp.selectResponse.size() < 2) {
    // Opened, but not in a form a client can use: no channel number the
    // interface allows, or no status word from the SELECT. Not left open.
    AIDL_LOGE("%s, openLogicalChannel: channel %u with %zu select bytes is unusable",
              mName.c_str(), channel, resp.selectResponse.size());
    if (channel >= 1 && channel <= kMaxLogicalChannel) mHidl->closeChannel(channel);
    return error(FAILED, "the channel opened without a usable select response");
  }
  _aidl_return->channelNumber = static_cast<int8_t>(channel);
  _aidl_return->selectResponse = resp.selectResponse;
  return ScopedAStatus::ok();
}

ScopedAStatus AidlFront::openBasicChannel(const std::vector<uint8_t>& in_aid, int8_t in_p2,
                                          std::vector<uint8_t>* _aidl_return) {
  AIDL_CALL("openBasicChannel");
  const pid_t caller = se_call::callerPid();
  std::lock_guard<std::mutex> g(mBasicLock);
  if (basicOwner() != 0) return error(CHANNEL_NOT_AVAILABLE, "the basic channel is already open");
  bool called = false;
  std::vector<uint8_t> select;
  SecureElementStatus status = SecureElementStatus::FAILED;
  Return<void> r = mHidl->openBasicChannel(
      in_aid, static_cast<uint8_t>(in_p2),
      [&](const hidl_vec<uint8_t>& rsp, SecureElementStatus st) {
        select = rsp;
        status = st;
        called = true;
      });
  if (!r.isOk() || !called) return error(FAILED, "openBasicChannel gave no result");
  if (status != SecureElementStatus::SUCCESS) {
    return errorOf(status, "openBasicChannel: " + toString(status));
  }
  if (select.size() < 2) return error(FAILED, "the select response has no status word");
  mBasicOwner = caller;
  *_aidl_return = std::move(select);
  return ScopedAStatus::ok();
}

ScopedAStatus AidlFront::transmit(const std::vector<uint8_t>& in_data,
                                  std::vector<uint8_t>* _aidl_return) {
  if (in_data.size() < 4) {
    return ScopedAStatus::fromExceptionCodeWithMessage(EX_ILLEGAL_ARGUMENT,
                                                       "a command APDU has at least 4 bytes");
  }
  const int channel = channelOfCla(in_data[0]);
  if (channel < 0) {
    return ScopedAStatus::fromExceptionCodeWithMessage(EX_ILLEGAL_ARGUMENT, "CLA FF is invalid");
  }
  AIDL_CALL("transmit");
  if (!channelOpen(static_cast<uint8_t>(channel), se_call::callerPid())) {
    return error(CHANNEL_NOT_AVAILABLE, "channel " + std::to_string(channel) + " is not open");
  }
  std::vector<uint8_t> response;
  Return<void> r =
      mHidl->transmit(in_data, [&](const hidl_vec<uint8_t>& rsp) { response = rsp; });
  // Fewer than two bytes hold no status word: the exchange failed (the eSE
  // front's marker byte, the SIM front's empty answer).
  if (!r.isOk() || response.size() < 2 || se_call::failed()) {
    return error(CHANNEL_NOT_AVAILABLE, "the exchange on channel " + std::to_string(channel) +
                                            " failed");
  }
  *_aidl_return = std::move(response);
  return ScopedAStatus::ok();
}

ScopedAStatus AidlFront::closeChannel(int8_t in_channelNumber) {
  AIDL_CALL("closeChannel");
  const int channel = static_cast<uint8_t>(in_channelNumber);
  if (channel == 0) {
    std::lock_guard<std::mutex> g(mBasicLock);
    if (mBasicOwner.load() != se_call::callerPid()) {
      return error(FAILED, "the basic channel is not open");
    }
    // Nothing to send for the basic channel; the HIDL front's close of it
    // only powers the element down as after every close.
    mHidl->closeChannel(0);
    mBasicOwner = 0;
    return ScopedAStatus::ok();
  }
  if (!channelOpen(static_cast<uint8_t>(channel), se_call::callerPid())) {
    return error(FAILED, "channel " + std::to_string(channel) + " is not open");
  }
  Return<SecureElementStatus> r = mHidl->closeChannel(static_cast<uint8_t>(channel));
  if (!r.isOk()) return error(FAILED, "closeChannel failed");
  const SecureElementStatus status = r;
  if (status != SecureElementStatus::SUCCESS) {
    return errorOf(status, "closeChannel: " + toString(status));
  }
  return ScopedAStatus::ok();
}

ScopedAStatus AidlFront::reset() {
  AIDL_CALL("reset");
  std::shared_ptr<ISecureElementCallback> cb;
  {
    std::lock_guard<std::mutex> g(mLock);
    auto it = mCallbacks.find(se_call::callerPid());
    if (it != mCallbacks.end()) cb = it->second;
  }
  if (cb == nullptr) return error(FAILED, "reset needs an init first");

  // Every open channel goes, whoever opened it: the element starts afresh. A
  // close the element cannot make now is queued by the front; the reset then
  // fails, as its closes have not run yet.
  bool closed = true;
  for (uint8_t c = 1; c <= kMaxLogicalChannel; ++c) {
    if (!mElement.logicalChannelOpen(c)) continue;
    se_call::Scope one(se_call::callerPid());
    mHidl->closeChannel(c);
    if (se_call::failed()) closed = false;
  }
  {
    std::lock_guard<std::mutex> g(mBasicLock);
    if (mBasicOwner.load() != 0) mHidl->closeChannel(0);
    mBasicOwner = 0;
  }
  if (!closed || !mElement.release()) {
    AIDL_LOGE("%s, reset: the element is busy, its closes are queued", mName.c_str());
    return error(FAILED, mName + " is busy: the reset's closes are queued");
  }
  ScopedAStatus st = cb->onStateChange(false, mName + " is being reset");
  if (!st.isOk()) AIDL_LOGE("%s, reset: onStateChange: %s", mName.c_str(), st.getDescription().c_str());
  if (!bringUp(cb)) {
    AIDL_LOGE("%s, reset: the element did not come back", mName.c_str());
    return error(FAILED, mName + " did not come back after the reset");
  }
  AIDL_LOGI("%s, reset done", mName.c_str());
  return ScopedAStatus::ok();
}

}  // namespace secure_element
}  // namespace hardware
}  // namespace android
}  // namespace aidl

#pragma once
// The AIDL face of one instance: translates the AIDL interface's calls,
// results and statuses to the HIDL front object that serves the same
// instance, so both interfaces reach the same card, locks and channel tables.
#include <aidl/android/hardware/secure_element/BnSecureElement.h>
#include <android/binder_auto_utils.h>
#include <android/hardware/secure_element/1.0/ISecureElement.h>

#include <atomic>
#include <functional>
#include <list>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include <sys/types.h>

class DeviceGate;

namespace aidl {
namespace android {
namespace hardware {
namespace secure_element {

using HidlSecureElement = ::android::hardware::secure_element::V1_0::ISecureElement;

class AidlFront : public BnSecureElement {
 public:
  // What the AIDL face needs from its instance beyond the HIDL calls.
  struct Element {
    // Whether logical channel 1..19 is open, as the front's own table says.
    std::function<bool(uint8_t channel)> logicalChannelOpen;
    // Lets go of the element before reset brings it up again; false when
    // that could not be done now (it is then queued).
    std::function<bool()> release;
    // The instance's gate: an AIDL call is admitted once for all the HIDL
    // calls it makes. Null: no admission of its own.
    DeviceGate* gate = nullptr;
  };

  AidlFront(::android::sp<HidlSecureElement> hidl, std::string name, Element element);
  ~AidlFront() override;

  ::ndk::ScopedAStatus closeChannel(int8_t in_channelNumber) override;
  ::ndk::ScopedAStatus getAtr(std::vector<uint8_t>* _aidl_return) override;
  ::ndk::ScopedAStatus init(
      const std::shared_ptr<ISecureElementCallback>& in_clientCallback) override;
  ::ndk::ScopedAStatus isCardPresent(bool* _aidl_return) override;
  ::ndk::ScopedAStatus openBasicChannel(const std::vector<uint8_t>& in_aid, int8_t in_p2,
                                        std::vector<uint8_t>* _aidl_return) override;
  ::ndk::ScopedAStatus openLogicalChannel(const std::vector<uint8_t>& in_aid, int8_t in_p2,
                                          LogicalChannelResponse* _aidl_return) override;
  ::ndk::ScopedAStatus reset() override;
  ::ndk::ScopedAStatus transmit(const std::vector<uint8_t>& in_data,
                                std::vector<uint8_t>* _aidl_return) override;

  // The HIDL front's death link for one AIDL client (see the bridge in the
  // .cpp); true when the client's binder can report its death.
  bool linkClient(AIBinder* client, const ::android::sp<::android::hardware::hidl_death_recipient>&
                                        recipient,
                  uint64_t cookie, const ::android::wp<::android::hidl::base::V1_0::IBase>& who);

 private:
  struct ClientLink {
    AidlFront* front;
    // Held, so that its address cannot stand for another client while the
    // link lasts; the link ends with the client.
    ::ndk::SpAIBinder client;
    pid_t pid;
    ::android::sp<::android::hardware::hidl_death_recipient> recipient;
    uint64_t cookie;
    ::android::wp<::android::hidl::base::V1_0::IBase> who;
  };

  static void onClientDied(void* cookie);
  void clientDied(ClientLink* link);
  // Brings the element up through the HIDL front's init with `cb` behind
  // it; true when the front reported it ready.
  bool bringUp(const std::shared_ptr<ISecureElementCallback>& cb);
  // Whether `channel` is open for the calling client: the basic channel only
  // for the client that opened it.
  bool channelOpen(uint8_t channel, pid_t caller);
  // The basic channel's owner, after letting go of one whose process is gone.
  pid_t basicOwner();

  const ::android::sp<HidlSecureElement> mHidl;
  const std::string mName;
  const Element mElement;
  ::ndk::ScopedAIBinder_DeathRecipient mDeath;

  std::mutex mLock;  // guards what follows; never held across a call out
  // Each client's callback from its last init, by process.
  std::map<pid_t, std::shared_ptr<ISecureElementCallback>> mCallbacks;
  std::list<std::unique_ptr<ClientLink>> mLinks;

  // The HIDL fronts do not track the basic channel; this face does, for
  // its clients: it belongs to the process that opened it (0: closed).
  // Held across a basic open or close so that two cannot race.
  std::mutex mBasicLock;
  std::atomic<pid_t> mBasicOwner{0};
};

}  // namespace secure_element
}  // namespace hardware
}  // namespace android
}  // namespace aidl

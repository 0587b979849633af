#pragma once
// "eSE1": the embedded secure element, driven through the vendor eSE library.
// The object has no state of its own; the channel table and the lock are
// process-wide, shared by every instance.
#include <pthread.h>

#include <cstdint>

#include <android/hardware/secure_element/1.0/ISecureElement.h>
#include <hidl/HidlSupport.h>

class DeviceGate;

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {

using ::android::sp;
using ::android::wp;
using ::android::hardware::hidl_death_recipient;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::Void;
using ::android::hidl::base::V1_0::IBase;

// The eSE front's lock: one normal (non-recursive) mutex, built before main.
class ThreadMutex {
 public:
  ThreadMutex();
  virtual ~ThreadMutex();
  ThreadMutex(const ThreadMutex&) = delete;
  ThreadMutex& operator=(const ThreadMutex&) = delete;
  pthread_mutex_t* get() { return &m_mutex; }

 private:
  pthread_mutex_t m_mutex;
};

struct SecureElement : public ISecureElement, public hidl_death_recipient {
  SecureElement() = default;

  Return<void> init(const sp<ISecureElementHalCallback>& clientCallback) override;
  Return<void> getAtr(getAtr_cb _hidl_cb) override;
  Return<bool> isCardPresent() override;
  Return<void> transmit(const hidl_vec<uint8_t>& data, transmit_cb _hidl_cb) override;
  Return<void> openLogicalChannel(const hidl_vec<uint8_t>& aid, uint8_t p2,
                                  openLogicalChannel_cb _hidl_cb) override;
  Return<void> openBasicChannel(const hidl_vec<uint8_t>& aid, uint8_t p2,
                                openBasicChannel_cb _hidl_cb) override;
  Return<SecureElementStatus> closeChannel(uint8_t channelNumber) override;

  void serviceDied(uint64_t cookie, const wp<IBase>& who) override;

  // Closes a logical channel without taking the lock: callers hold it already
  // (a failed open, init's sweep, a queued close).
  static SecureElementStatus internalCloseChannel(uint8_t channelNumber);
  // Lets go of the library (phQvEse_close) as soon as it is free, before any
  // later call; true when that happened now. The card drops every channel.
  static bool releaseLibrary(const char* op);
  // The gate every eSE call passes (admission, waiting, queued closes).
  static DeviceGate& gate();

  // Whether logical channel `channelNumber` is held open by this front (its
  // channel table); false for 0, the basic channel, which it does not track.
  static bool isLogicalChannelOpen(uint8_t channelNumber);
};

}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

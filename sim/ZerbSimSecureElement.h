#pragma once
// "SIM1": the UICC in the modem presented as a secure element. Each call picks
// the modem that carries the SIM the NFC side is switched to and turns into
// one request for that modem's worker.
#include <pthread.h>

#include <atomic>
#include <cstdint>

#include <android/hardware/secure_element/1.0/ISecureElement.h>
#include <hidl/HidlSupport.h>

class DeviceGate;

// Logical channels 0 to 19 opened through the SIM front and not closed
// through it; written under the front's lock, read without it (the AIDL
// face asks before every call and must not wait behind a slow modem).
#define SIM_CHANNEL_MAX 20
extern std::atomic<uint8_t> g_simOpenedChannels[SIM_CHANNEL_MAX];
// 1 once an init found the system up for 120 s or more; -1 before.
extern std::atomic<int32_t> timeflag;

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

// The SIM front's lock: one normal (non-recursive) mutex, built before main.
class ZerbThreadMutex {
 public:
  ZerbThreadMutex();
  virtual ~ZerbThreadMutex();
  pthread_mutex_t* get() { return &m_mutex; }

 private:
  pthread_mutex_t m_mutex;
};

struct ZerbSimSecureElement : public ISecureElement, public hidl_death_recipient {
  explicit ZerbSimSecureElement(int modemId);
  ~ZerbSimSecureElement() override;

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

  int modemId() const { return m_modem_id.load(); }

  // Whether `channelNumber` was opened through this front and not closed
  // through it (g_simOpenedChannels).
  static bool isChannelOpen(uint8_t channelNumber);
  // The gate every SIM call passes (admission, waiting, queued closes).
  static DeviceGate& gate();

 private:
  void selectModem(const char* operation);
  // closeChannel's work, with the front's lock held.
  SecureElementStatus closeHeld(uint8_t channelNumber, const char* operation);

  // Written under the front's lock, read without it by init and serviceDied.
  std::atomic<int32_t> m_modem_id;
};

}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

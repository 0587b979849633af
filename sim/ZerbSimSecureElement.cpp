#include "ZerbSimSecureElement.h"

#include <log/log.h>

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {

namespace {
constexpr const char* kTag = "ZerbSimSecureElement";
}

#define SIM_LOGD(...) __android_log_buf_print(LOG_ID_RADIO, ANDROID_LOG_DEBUG, kTag, __VA_ARGS__)
#define SIM_LOGE(...) __android_log_buf_print(LOG_ID_RADIO, ANDROID_LOG_ERROR, kTag, __VA_ARGS__)

ZerbThreadMutex::ZerbThreadMutex() {
  pthread_mutexattr_t attr;
  pthread_mutexattr_init(&attr);
  pthread_mutex_init(&m_mutex, &attr);
  pthread_mutexattr_destroy(&attr);
}

ZerbThreadMutex::~ZerbThreadMutex() { pthread_mutex_destroy(&m_mutex); }

// The SIM front's lock, built before main.
static ZerbThreadMutex g_simMutex;

ZerbSimSecureElement::ZerbSimSecureElement(int modemId) {
  SIM_LOGD("%s, modemid %d", "ZerbSimSecureElement", modemId);
  m_modem_id = (modemId == 0 || modemId == 1) ? modemId : 0;
}

ZerbSimSecureElement::~ZerbSimSecureElement() {}

// Until the modem side exists, the front answers as one whose modem is not up.
Return<void> ZerbSimSecureElement::init(const sp<ISecureElementHalCallback>& clientCallback) {
  (void)clientCallback;
  return Void();
}

Return<void> ZerbSimSecureElement::getAtr(getAtr_cb _hidl_cb) {
  _hidl_cb(hidl_vec<uint8_t>());
  return Void();
}

Return<bool> ZerbSimSecureElement::isCardPresent() { return false; }

Return<void> ZerbSimSecureElement::transmit(const hidl_vec<uint8_t>&, transmit_cb _hidl_cb) {
  _hidl_cb(hidl_vec<uint8_t>());
  return Void();
}

Return<void> ZerbSimSecureElement::openLogicalChannel(const hidl_vec<uint8_t>&, uint8_t,
                                                      openLogicalChannel_cb _hidl_cb) {
  LogicalChannelResponse response;
  _hidl_cb(response, SecureElementStatus::FAILED);
  return Void();
}

Return<void> ZerbSimSecureElement::openBasicChannel(const hidl_vec<uint8_t>&, uint8_t,
                                                    openBasicChannel_cb _hidl_cb) {
  SIM_LOGE("%s, not allowed open basic channel", "openBasicChannel");
  _hidl_cb(hidl_vec<uint8_t>(), SecureElementStatus::CHANNEL_NOT_AVAILABLE);
  return Void();
}

Return<SecureElementStatus> ZerbSimSecureElement::closeChannel(uint8_t) {
  return SecureElementStatus::FAILED;
}

void ZerbSimSecureElement::serviceDied(uint64_t, const wp<IBase>&) {
  SIM_LOGD("%s, enter, modem_id: %d", "serviceDied", m_modem_id);
}

}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

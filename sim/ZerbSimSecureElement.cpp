#include "ZerbSimSecureElement.h"

#include <log/log.h>
#include <securec.h>
#include <errno.h>

#include <string>

#include "async_cmd.h"
#include "modem_select.h"
#include "se_delay.h"
#include "se_modem_id.h"
#include "se_uptime.h"
#include "se_device_gate.h"

std::atomic<uint8_t> g_simOpenedChannels[SIM_CHANNEL_MAX];
std::atomic<int32_t> timeflag{-1};

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {

namespace {
constexpr const char* kTag = "ZerbSimSecureElement";
// Settling time the modem needs after boot before the first request.
constexpr uint64_t kSettleMicros = 1500000;
constexpr long kSettledUptimeSeconds = 120;
}  // namespace

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

namespace {

hidl_vec<uint8_t> bytesOf(const uint8_t* data, int32_t count) {
  hidl_vec<uint8_t> out;
  out.resize(static_cast<size_t>(count));
  (void)memcpy_s(out.data(), out.size(), data, static_cast<size_t>(count));
  return out;
}

void settleAfterBoot() {
  if (timeflag == 1) return;
  long uptime = 0;
  if (se_uptime_seconds(&uptime) != 0) {
    SIM_LOGD("Failed to get sysinfo\n");
    se_delay::sleepMicros(kSettleMicros);
    SIM_LOGD("%s, SLEEP 1.5S", "init");
    return;
  }
  SIM_LOGD("%s, time is %ld", "print_system_boot_time", uptime);
  if (uptime >= kSettledUptimeSeconds) {
    timeflag = 1;
    return;
  }
  se_delay::sleepMicros(kSettleMicros);
  SIM_LOGD("%s, SLEEP 1.5S", "init");
}

// The modem for this call, made current; called with the front's lock held.
int32_t currentModem(const char* operation) {
  int32_t modem = communication_which_modem();
  if (modem < 0) {
    SIM_LOGE("%s, modem_id error: %d", operation, modem);
    modem = 0;
  }
  SIM_LOGD("%s, modem_id: %d", operation, modem);
  g_ulModemId = modem;
  return modem;
}

// Request 6 for `channel` on the current modem, with the front's lock held.
// The flag goes whatever the modem answered: a release the modem could not
// take now is the request engine's to repeat (it keeps the session until the
// modem has released it), so the front has nothing left to retry.
SecureElementStatus closeOnModem(int32_t modem, uint8_t channel) {
  SecureElementStatus status = SecureElementStatus::FAILED;
  g_asyncCmd.param = static_cast<int32_t>(channel);
  if (asyncCmdPush(modem, REQUEST_CLOSE_LOGICAL_CHANNEL, nullptr, 0) == 0) {
    status = static_cast<SecureElementStatus>(g_asyncCmd.param & 0xFF);
  }
  if (channel < SIM_CHANNEL_MAX) g_simOpenedChannels[channel] = 0;
  ZerbSimSecureElement::gate().closed(channel);
  return status;
}

DeviceGate::Outcome closeQueued(uint8_t channel) {
  (void)closeOnModem(currentModem("closeChannel"), channel);
  return DeviceGate::Outcome::kDone;
}

}  // namespace

DeviceGate& ZerbSimSecureElement::gate() {
  // Lives as long as the process: a pool thread may still wait on it at exit.
  static DeviceGate* instance = new DeviceGate(DeviceGate::Config{
      "SIM1", LOG_ID_RADIO, kTag, g_simMutex.get(), kCallersPerInstance,
      "vendor.secure_element.sim.hang_ms", asyncCmdSilenceMicros, closeQueued});
  return *instance;
}

ZerbSimSecureElement::ZerbSimSecureElement(int modemId) {
  SIM_LOGD("%s, modemid %d", "ZerbSimSecureElement", modemId);
  m_modem_id = (modemId == 0 || modemId == 1) ? modemId : 0;
}

ZerbSimSecureElement::~ZerbSimSecureElement() {}

// Picks the modem for this call and makes it current. Called under g_simMutex.
void ZerbSimSecureElement::selectModem(const char* operation) {
  m_modem_id = currentModem(operation);
}

Return<void> ZerbSimSecureElement::init(const sp<ISecureElementHalCallback>& clientCallback) {
  SIM_LOGD("%s, m_modem_id: %d", "init", m_modem_id.load());
  g_ulModemId = m_modem_id.load();
  if (clientCallback == nullptr) {
    SIM_LOGE("%s, clientCallback is NULL", "init");
    return Void();
  }
  DeviceGate::Pass pass = gate().admit("init");
  if (!pass.ok()) return Void();
  // The cookie names the client, so that its death closes its channels.
  const pid_t client = se_call::callerPid();
  Return<bool> linked = clientCallback->linkToDeath(this, static_cast<uint64_t>(client));
  if (linked.isOk() && static_cast<bool>(linked)) gate().linked(client);

  // Channels 1 and 2 are left alone: the sweep starts at 3. So are channels
  // another client still holds: the sweep is for channels left behind. A
  // close that cannot be made now is queued by closeChannel and made later.
  for (uint8_t channel = 3; channel < SIM_CHANNEL_MAX; channel++) {
    if (g_simOpenedChannels[channel] != 0 && !gate().heldByAnother(channel, client)) {
      (void)closeChannel(channel);
    }
  }

  int32_t dualSim = judge_dual_sim();
  SIM_LOGD("%s, dual_sim = %d", "init", dualSim);
  g_ulModemId = 0;
  int32_t ret0 = init_at_channel(0);
  int32_t ret1 = 0;
  if (dualSim == 2) {
    SIM_LOGD("%s, dual_sim init second pthread", "init");
    g_ulModemId = 1;
    ret1 = init_at_channel(1);
  }
  if (ret0 != 0 || ret1 != 0) {
    SIM_LOGE("%s, init_at_channel FAIL", "init");
    return Void();
  }
  SIM_LOGD("%s, m%d init_at_channel SUCCESS", "init", static_cast<int32_t>(g_ulModemId));

  settleAfterBoot();
  (void)clientCallback->onStateChange(true);
  return Void();
}

Return<void> ZerbSimSecureElement::getAtr(getAtr_cb _hidl_cb) {
  DeviceGate::Pass pass = gate().enter("getAtr");
  hidl_vec<uint8_t> atr;
  if (!pass.ok()) {
    _hidl_cb(atr);
    return Void();
  }
  selectModem("getAtr");
  if (asyncCmdPush(m_modem_id, REQUEST_GET_ATR, nullptr, 0) == 0) {
    SIM_LOGD("%s, now copy data, modem_id: %d", "getAtr", m_modem_id.load());
    if (g_asyncCmd.datalen >= 1 && g_asyncCmd.datalen <= ASYNC_CMD_DATA_MAX) {
      atr = bytesOf(g_asyncCmd.data, g_asyncCmd.datalen);
    } else if (g_asyncCmd.param != 0 || g_asyncCmd.datalen < 0) {
      // No ATR from a modem that should give one; an empty one given
      // deliberately (param 0, length 0) is an answer.
      se_call::markFailed();
    }
  } else {
    se_call::markFailed();
  }
  _hidl_cb(atr);
  return Void();
}

Return<bool> ZerbSimSecureElement::isCardPresent() {
  DeviceGate::Pass pass = gate().enter("isCardPresent");
  if (!pass.ok()) return false;
  selectModem("isCardPresent");
  bool present = false;
  if (asyncCmdPush(m_modem_id, REQUEST_GET_CARD_PRESENT, nullptr, 0) == 0) {
    present = g_asyncCmd.param > 0;
    if (g_asyncCmd.param < 0) se_call::markFailed();
  } else {
    se_call::markFailed();
  }
  return present;
}

Return<void> ZerbSimSecureElement::transmit(const hidl_vec<uint8_t>& data, transmit_cb _hidl_cb) {
  DeviceGate::Pass pass = gate().enter("transmit");
  hidl_vec<uint8_t> response;
  if (!pass.ok()) {
    _hidl_cb(response);
    return Void();
  }
  selectModem("transmit");
  // Sizes beyond int32 are refused by the push as an invalid length.
  int32_t len = data.size() > static_cast<size_t>(INT32_MAX) ? -1 : static_cast<int32_t>(data.size());
  if (asyncCmdPush(m_modem_id, REQUEST_TRANSMIT_APDU, data.data(), len) == 0) {
    SIM_LOGD("%s, now copy data, modem_id: %d", "transmit", m_modem_id.load());
    if (g_asyncCmd.param == 0 && g_asyncCmd.datalen >= 1 &&
        g_asyncCmd.datalen <= ASYNC_CMD_DATA_MAX) {
      response = bytesOf(g_asyncCmd.data, g_asyncCmd.datalen);
    }
  }
  if (response.size() == 0) se_call::markFailed();
  _hidl_cb(response);
  return Void();
}

Return<void> ZerbSimSecureElement::openLogicalChannel(const hidl_vec<uint8_t>& aid, uint8_t p2,
                                                      openLogicalChannel_cb _hidl_cb) {
  DeviceGate::Pass pass = gate().enter("openLogicalChannel");
  LogicalChannelResponse response;
  SecureElementStatus status = SecureElementStatus::FAILED;
  if (!pass.ok()) {
    _hidl_cb(response, status);
    return Void();
  }
  selectModem("openLogicalChannel");
  g_asyncCmd.param = static_cast<int32_t>(p2);
  int32_t len = aid.size() > static_cast<size_t>(INT32_MAX) ? -1 : static_cast<int32_t>(aid.size());
  if (asyncCmdPush(m_modem_id, REQUEST_OPEN_LOGICAL_CHANNEL, aid.data(), len) == 0) {
    SIM_LOGD("%s, now copy data, modem_id: %d", "openLogicalChannel", m_modem_id.load());
    uint8_t code = static_cast<uint8_t>(g_asyncCmd.param & 0xFF);
    if (code != 0) {
      status = static_cast<SecureElementStatus>(code);
    } else {
      uint8_t channel = g_asyncCmd.data[0];
      if (channel < SIM_CHANNEL_MAX) {
        g_simOpenedChannels[channel] = 1;
        gate().opened(channel, se_call::callerPid());
      }
      response.channelNumber = channel;
      if (g_asyncCmd.datalen >= 1 && g_asyncCmd.datalen <= ASYNC_CMD_SELECT_RESP_MAX) {
        response.selectResponse = bytesOf(g_asyncCmd.data + 1, g_asyncCmd.datalen);
      }
      status = SecureElementStatus::SUCCESS;
    }
  }
  _hidl_cb(response, status);
  return Void();
}

Return<void> ZerbSimSecureElement::openBasicChannel(const hidl_vec<uint8_t>&, uint8_t,
                                                    openBasicChannel_cb _hidl_cb) {
  SIM_LOGE("%s, not allowed open basic channel", "openBasicChannel");
  _hidl_cb(hidl_vec<uint8_t>(), SecureElementStatus::CHANNEL_NOT_AVAILABLE);
  return Void();
}

Return<SecureElementStatus> ZerbSimSecureElement::closeChannel(uint8_t channelNumber) {
  DeviceGate::Pass pass = gate().enter("closeChannel");
  if (!pass.ok()) {
    // The caller no longer holds the channel: it is closed as soon as the
    // modem is free, and the caller learns that it was not closed now.
    gate().defer([channelNumber] { return closeQueued(channelNumber); },
                 "closeChannel " + std::to_string(channelNumber), channelNumber);
    return SecureElementStatus::FAILED;
  }
  return closeHeld(channelNumber, "closeChannel");
}

SecureElementStatus ZerbSimSecureElement::closeHeld(uint8_t channelNumber, const char* operation) {
  selectModem(operation);
  return closeOnModem(m_modem_id, channelNumber);
}

bool ZerbSimSecureElement::isChannelOpen(uint8_t channelNumber) {
  return channelNumber < SIM_CHANNEL_MAX && g_simOpenedChannels[channelNumber] != 0;
}

void ZerbSimSecureElement::serviceDied(uint64_t cookie, const wp<IBase>&) {
  SIM_LOGD("%s, enter, modem_id: %d", "serviceDied", m_modem_id.load());
  // The channels the dead client opened are closed as soon as the modem is
  // free; a death notice never waits for it.
  if (cookie != 0) gate().clientDied(static_cast<pid_t>(cookie));
}

}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

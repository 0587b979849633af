#include "ZerbSimSecureElement.h"

#include <log/log.h>
#include <securec.h>
#include <errno.h>

#include "async_cmd.h"
#include "modem_select.h"
#include "se_delay.h"
#include "se_modem_id.h"
#include "se_uptime.h"

uint8_t g_simOpenedChannels[SIM_CHANNEL_MAX];
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
// How long a SIM call waits for the front's lock while the call holding it
// has a modem command out with no answer line. A working modem answers an
// AT command within about 200 ms; half a second without a line means the
// modem has gone silent, and the waiter gives up so that its RPC thread is
// free for the eSE and for death notices. While answers keep coming the
// waiter keeps waiting, however long the holder's exchange takes.
constexpr int64_t kModemSilenceMicros = 500000;
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

// Takes g_simMutex, waiting only while the holder's modem is working (see
// kModemSilenceMicros). False, with a log line, when it gave up.
bool lockUnlessModemSilent(const char* operation) {
  if (pthread_mutex_trylock(g_simMutex.get()) == 0) return true;
  const int64_t bound = static_cast<int64_t>(se_delay::scaledMicros(kModemSilenceMicros));
  for (;;) {
    int64_t silent = asyncCmdSilenceMicros();
    if (silent >= bound) {
      SIM_LOGE("%s, modem silent for %lld ms, SIM busy: call given up", operation,
               static_cast<long long>(silent / 1000));
      return false;
    }
    // Sleep on the lock until the modem would count as silent; answers
    // that come meanwhile move that moment on. The deadline is on the
    // wall clock, as the lock's timed wait wants, and is taken afresh
    // each round, so a clock change costs at most one round.
    int64_t wait = bound - silent;
    struct timespec deadline;
    clock_gettime(CLOCK_REALTIME, &deadline);
    int64_t nsec = deadline.tv_nsec + (wait % 1000000) * 1000;
    deadline.tv_sec += static_cast<time_t>(wait / 1000000 + nsec / 1000000000);
    deadline.tv_nsec = static_cast<long>(nsec % 1000000000);
    int rc = pthread_mutex_timedlock(g_simMutex.get(), &deadline);
    if (rc == 0) return true;
    if (rc != ETIMEDOUT) {
      SIM_LOGE("%s, SIM lock failed: %d", operation, rc);
      return false;
    }
  }
}

// Holds g_simMutex for one scope, when it could be had (see held()).
class SimLock {
 public:
  explicit SimLock(const char* operation) : held_(lockUnlessModemSilent(operation)) {}
  ~SimLock() {
    if (held_) pthread_mutex_unlock(g_simMutex.get());
  }
  SimLock(const SimLock&) = delete;
  SimLock& operator=(const SimLock&) = delete;
  bool held() const { return held_; }

 private:
  const bool held_;
};

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

}  // namespace

ZerbSimSecureElement::ZerbSimSecureElement(int modemId) {
  SIM_LOGD("%s, modemid %d", "ZerbSimSecureElement", modemId);
  m_modem_id = (modemId == 0 || modemId == 1) ? modemId : 0;
}

ZerbSimSecureElement::~ZerbSimSecureElement() {}

// Picks the modem for this call and makes it current. Called under g_simMutex.
void ZerbSimSecureElement::selectModem(const char* operation) {
  int32_t modem = communication_which_modem();
  if (modem < 0) {
    SIM_LOGE("%s, modem_id error: %d", operation, modem);
    modem = 0;
  }
  m_modem_id = modem;
  SIM_LOGD("%s, modem_id: %d", operation, modem);
  g_ulModemId = modem;
}

Return<void> ZerbSimSecureElement::init(const sp<ISecureElementHalCallback>& clientCallback) {
  SIM_LOGD("%s, m_modem_id: %d", "init", m_modem_id.load());
  g_ulModemId = m_modem_id.load();
  if (clientCallback == nullptr) {
    SIM_LOGE("%s, clientCallback is NULL", "init");
    return Void();
  }
  (void)clientCallback->linkToDeath(this, 0);

  // Channels 1 and 2 are left alone: the sweep starts at 3.
  // A silent modem ends the sweep: its closes could not be sent anyway, and
  // the flags stay for the next init.
  for (uint8_t channel = 3; channel < SIM_CHANNEL_MAX; channel++) {
    bool opened;
    {
      SimLock lock("init");
      if (!lock.held()) break;
      opened = g_simOpenedChannels[channel] != 0;
    }
    if (opened) (void)closeChannel(channel);
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
  SimLock lock("getAtr");
  hidl_vec<uint8_t> atr;
  if (!lock.held()) {
    _hidl_cb(atr);
    return Void();
  }
  selectModem("getAtr");
  if (asyncCmdPush(m_modem_id, REQUEST_GET_ATR, nullptr, 0) == 0) {
    SIM_LOGD("%s, now copy data, modem_id: %d", "getAtr", m_modem_id.load());
    if (g_asyncCmd.datalen >= 1 && g_asyncCmd.datalen <= ASYNC_CMD_DATA_MAX) atr = bytesOf(g_asyncCmd.data, g_asyncCmd.datalen);
  }
  _hidl_cb(atr);
  return Void();
}

Return<bool> ZerbSimSecureElement::isCardPresent() {
  SimLock lock("isCardPresent");
  if (!lock.held()) return false;
  selectModem("isCardPresent");
  bool present = false;
  if (asyncCmdPush(m_modem_id, REQUEST_GET_CARD_PRESENT, nullptr, 0) == 0) {
    present = g_asyncCmd.param > 0;
  }
  return present;
}

Return<void> ZerbSimSecureElement::transmit(const hidl_vec<uint8_t>& data, transmit_cb _hidl_cb) {
  SimLock lock("transmit");
  hidl_vec<uint8_t> response;
  if (!lock.held()) {
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
  _hidl_cb(response);
  return Void();
}

Return<void> ZerbSimSecureElement::openLogicalChannel(const hidl_vec<uint8_t>& aid, uint8_t p2,
                                                      openLogicalChannel_cb _hidl_cb) {
  SimLock lock("openLogicalChannel");
  LogicalChannelResponse response;
  SecureElementStatus status = SecureElementStatus::FAILED;
  if (!lock.held()) {
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
      if (channel < SIM_CHANNEL_MAX) g_simOpenedChannels[channel] = 1;
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
  // Given up, the channel stays flagged: it was not closed.
  SimLock lock("closeChannel");
  if (!lock.held()) return SecureElementStatus::FAILED;
  selectModem("closeChannel");
  SecureElementStatus status = SecureElementStatus::FAILED;
  g_asyncCmd.param = static_cast<int32_t>(channelNumber);
  if (asyncCmdPush(m_modem_id, REQUEST_CLOSE_LOGICAL_CHANNEL, nullptr, 0) == 0) {
    status = static_cast<SecureElementStatus>(g_asyncCmd.param & 0xFF);
  }
  if (channelNumber < SIM_CHANNEL_MAX) g_simOpenedChannels[channelNumber] = 0;
  return status;
}

void ZerbSimSecureElement::serviceDied(uint64_t, const wp<IBase>&) {
  SIM_LOGD("%s, enter, modem_id: %d", "serviceDied", m_modem_id.load());
}

}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

#include "SecureElement.h"

#include <atomic>
#include <cstdlib>
#include <string>
#include <memory>
#include <vector>

#include <log/log.h>
#include <securec.h>

#include "ese_buffer.h"
#include "ese_library.h"
#include "ese_qv_hal.h"
#include "se_device_gate.h"

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {

namespace {

constexpr const char* kTag = "qvese@1.0-service";

// Every IPC response, the logical channel's SELECT and MANAGE CHANNEL close
// are answered into this many bytes; the basic channel's SELECT into fewer.
constexpr size_t kRspBufSize = 270;
constexpr size_t kBasicSelectRspBufSize = 256;
constexpr size_t kShortApduSize = 5;

// Stand-ins for a channel number or a response when the card gave none.
constexpr uint8_t kMarkerNotReady = 0x7F;
constexpr uint8_t kMarkerExchangeFailed = 0x7E;
constexpr uint8_t kNoChannel = 0xFF;
constexpr uint8_t kMarkerTransmitFailed = 0x1F;

constexpr uint8_t kInsManageChannel = 0x70;
constexpr uint8_t kInsSelect = 0xA4;
constexpr uint8_t kInsGetResponse = 0xC0;

constexpr const char* kPowerOff = "korva_poweroff";

// Logical channels 0..3: the ones whose CLA is the channel number itself, and
// the only ones this front tracks and hands out.
constexpr size_t kTrackedChannels = 4;

// Atomic because init reads the flags without the lock while an open or close
// may be writing them under it.
std::atomic<int32_t> g_openedChannels[kTrackedChannels];

struct FreeDeleter {
  void operator()(uint8_t* p) const { std::free(p); }
};
using Buffer = std::unique_ptr<uint8_t, FreeDeleter>;

// A per-call working buffer; never zero bytes long, so an empty command still
// has somewhere to point.
Buffer allocBuffer(size_t size, bool zeroFill) {
  return Buffer(eseBufferAlloc(size == 0 ? 1 : size, zeroFill));
}

namespace lib = ese_library;

bool isTracked(uint8_t channel) { return channel < kTrackedChannels; }

// Bytes [0, len) of buf as a vector, len already bounded by the caller.
hidl_vec<uint8_t> bytesOf(const uint8_t* buf, size_t len) {
  return hidl_vec<uint8_t>(buf, buf + len);
}

// The data bytes of a field-wise response followed by its status word.
hidl_vec<uint8_t> dataAndSw(const phQvEse_7816_rpdu& rpdu, size_t bufSize) {
  const size_t len = rpdu.len < bufSize ? rpdu.len : bufSize;
  std::vector<uint8_t> out(rpdu.pdata, rpdu.pdata + len);
  out.push_back(rpdu.sw1);
  out.push_back(rpdu.sw2);
  return hidl_vec<uint8_t>(std::move(out));
}

size_t boundedLen(const phQvEse_data& rsp, size_t bufSize) {
  return rsp.len < bufSize ? rsp.len : bufSize;
}

// One exchange over the IPC path: `cmdLen` bytes from `cmdBuf`, the answer
// into `rspBuf` (kRspBufSize bytes). `*rspLen` gets the answer's length as
// reported, bounded to that buffer, whatever the return code.
int32_t transmitByIpc(uint8_t* cmdBuf, size_t cmdLen, uint8_t* rspBuf, size_t* rspLen) {
  phQvEse_data cmdApdu;
  phQvEse_data rspApdu;
  memset_s(&cmdApdu, sizeof(cmdApdu), 0, sizeof(cmdApdu));
  memset_s(&rspApdu, sizeof(rspApdu), 0, sizeof(rspApdu));
  cmdApdu.len = static_cast<uint32_t>(cmdLen);
  cmdApdu.p_data = cmdBuf;
  rspApdu.len = 0;
  rspApdu.p_data = rspBuf;
  const int32_t rc = lib::transmitByIpc(&cmdApdu, &rspApdu);
  *rspLen = boundedLen(rspApdu, kRspBufSize);
  return rc;
}

// SELECT status word, both channel kinds (61xx is handled by the caller).
SecureElementStatus mapSelectSw(uint8_t sw1, uint8_t sw2) {
  if (sw1 == 0x90 && sw2 == 0x00) return SecureElementStatus::SUCCESS;
  if ((sw1 == 0x67 && sw2 == 0x00) || (sw1 == 0x6A && sw2 == 0x82))
    return SecureElementStatus::NO_SUCH_ELEMENT_ERROR;
  if (sw1 == 0x6A && sw2 == 0x86) return SecureElementStatus::UNSUPPORTED_OPERATION;
  return SecureElementStatus::FAILED;
}

// GET RESPONSE status word; there is never a second GET RESPONSE, so 61xx fails.
SecureElementStatus mapGetResponseSw(uint8_t sw1, uint8_t sw2, bool basicChannel) {
  if (sw1 == 0x90 && sw2 == 0x00) return SecureElementStatus::SUCCESS;
  if (sw1 == 0x67 && sw2 == 0x00) return SecureElementStatus::NO_SUCH_ELEMENT_ERROR;
  if (sw1 == 0x6A && sw2 == 0x86) return SecureElementStatus::UNSUPPORTED_OPERATION;
  if (sw1 == 0x6A && sw2 == 0x82)
    return basicChannel ? SecureElementStatus::NO_SUCH_ELEMENT_ERROR : SecureElementStatus::FAILED;
  return SecureElementStatus::FAILED;
}

// MANAGE CHANNEL open refusals; 90 00 is handled by the caller.
SecureElementStatus mapManageOpenSw(uint8_t sw1, uint8_t sw2) {
  if (sw1 == 0x6A && sw2 == 0x81) return SecureElementStatus::CHANNEL_NOT_AVAILABLE;
  if ((sw1 == 0x6D || sw1 == 0x6E) && sw2 == 0x00) return SecureElementStatus::UNSUPPORTED_OPERATION;
  return SecureElementStatus::FAILED;
}

void powerOff() { (void)lib::setPower(kPowerOff); }

// A SELECT by DF name on `cla`'s channel, the AID copied into `aidBuf`.
void fillSelect(phQvEse_7816_cpdu* cpdu, phQvEse_7816_rpdu* rpdu, uint8_t cla, uint8_t p2,
                const hidl_vec<uint8_t>& aid, uint8_t* aidBuf, uint8_t* rspBuf) {
  memset_s(cpdu, sizeof(*cpdu), 0, sizeof(*cpdu));
  memset_s(rpdu, sizeof(*rpdu), 0, sizeof(*rpdu));
  cpdu->cla = cla;
  cpdu->ins = kInsSelect;
  cpdu->p1 = 0x04;
  cpdu->p2 = p2;
  cpdu->lc = static_cast<uint16_t>(aid.size());
  cpdu->cpdu_type = 0;
  if (aid.size() != 0) memcpy_s(aidBuf, aid.size(), aid.data(), aid.size());
  cpdu->pdata = aidBuf;
  cpdu->le_type = 1;
  cpdu->le = 256;
  rpdu->pdata = rspBuf;
  rpdu->len = 2;
}

// What a close's exchange came to: the library failed (the card never saw
// it), or the card answered, with 90 00 or with a refusal.
enum class CloseResult { kLibraryFailed, kClosed, kRefused };

DeviceGate::Outcome outcomeOf(CloseResult r) {
  return r == CloseResult::kLibraryFailed ? DeviceGate::Outcome::kRetry
                                          : DeviceGate::Outcome::kDone;
}

CloseResult closeTracked(uint8_t channel, const char* op);

// A close of `channel` the library could not make now, made again later;
// none once the library's close has dropped the channel (it has no owner
// then), which also keeps it from closing a later open's channel.
void closeLater(uint8_t channel, const char* op) {
  if (!SecureElement::gate().owned(channel)) return;
  SecureElement::gate().defer(
      [channel, op] {
        if (!SecureElement::gate().owned(channel)) return DeviceGate::Outcome::kDone;
        return outcomeOf(closeTracked(channel, op));
      },
      std::string(op) + ", close of channel " + std::to_string(channel), channel);
}

// Logs the closing and the outcome of a failed logical open's clean-up.
void failedSelectClose(const char* op, uint8_t channel) {
  __android_log_print(ANDROID_LOG_DEBUG, kTag, "%s select return fail,try to close channel %d", op,
                      channel);
  const CloseResult r = closeTracked(channel, "internalCloseChannel");
  if (r != CloseResult::kClosed) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s select return fail,close channel fail ", op);
  }
  if (r == CloseResult::kLibraryFailed) closeLater(channel, op);
}

// MANAGE CHANNEL close of `channel`, sent on the channel named by `cla`.
CloseResult manageClose(uint8_t cla, uint8_t channel, const char* op) {
  Buffer rsp = allocBuffer(kRspBufSize, true);
  if (!rsp) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s rpdu.pdata malloc fail!", op);
    return CloseResult::kLibraryFailed;
  }
  phQvEse_7816_cpdu cpdu;
  phQvEse_7816_rpdu rpdu;
  memset_s(&cpdu, sizeof(cpdu), 0, sizeof(cpdu));
  memset_s(&rpdu, sizeof(rpdu), 0, sizeof(rpdu));
  cpdu.cla = cla;
  cpdu.ins = kInsManageChannel;
  cpdu.p1 = 0x80;
  cpdu.p2 = channel;
  cpdu.lc = 0;
  cpdu.pdata = nullptr;
  cpdu.le_type = 0;
  cpdu.le = 0x9000;
  rpdu.pdata = rsp.get();
  rpdu.len = 0;
  if (lib::transceive(&cpdu, &rpdu) != 0) return CloseResult::kLibraryFailed;
  return rpdu.sw1 == 0x90 && rpdu.sw2 == 0x00 ? CloseResult::kClosed : CloseResult::kRefused;
}

// The close shared by closeChannel and internalCloseChannel; `op` names the
// caller in the log. Channel 0 is the basic channel, never closed. Above 3
// the CLA would not be the channel number, so a close built from it would
// hit another channel; this front never hands such a channel out, so there
// is nothing to close.
CloseResult closeTracked(uint8_t channel, const char* op) {
  __android_log_print(ANDROID_LOG_INFO, kTag, "%s enter!", op);
  CloseResult r = CloseResult::kRefused;
  if (channel != 0 && isTracked(channel)) r = manageClose(channel, channel, op);
  // A close the library could not make stays owed while the channel is
  // still the card's (it has an owner): the flag stays for init's sweep and
  // the gate makes it again.
  const bool owed = r == CloseResult::kLibraryFailed && SecureElement::gate().owned(channel);
  if (isTracked(channel) && !owed) {
    g_openedChannels[channel].store(0);
    SecureElement::gate().closed(channel);
  }
  powerOff();
  return r;
}

SecureElementStatus statusOf(CloseResult r) {
  return r == CloseResult::kClosed ? SecureElementStatus::SUCCESS : SecureElementStatus::FAILED;
}

DeviceGate::Outcome closeForGate(uint8_t channel) {
  return outcomeOf(closeTracked(channel, "internalCloseChannel"));
}

}  // namespace

// The eSE lock is built before the SIM front's: both are plain statics, and
// the priority keeps that order whatever order the linker lays the units in.
static ThreadMutex g_eseMutex __attribute__((init_priority(65000)));

ThreadMutex::ThreadMutex() {
  pthread_mutexattr_t attr;
  pthread_mutexattr_init(&attr);
  pthread_mutex_init(&m_mutex, &attr);
  pthread_mutexattr_destroy(&attr);
}

ThreadMutex::~ThreadMutex() { pthread_mutex_destroy(&m_mutex); }

DeviceGate& SecureElement::gate() {
  // Lives as long as the process: a pool thread may still be in the library
  // when the process exits.
  static DeviceGate* instance = new DeviceGate(DeviceGate::Config{
      "eSE1", LOG_ID_MAIN, kTag, g_eseMutex.get(), kCallersPerInstance,
      "vendor.secure_element.ese.hang_ms", lib::silenceMicros, closeForGate});
  return *instance;
}

Return<void> SecureElement::init(const sp<ISecureElementHalCallback>& clientCallback) {
  __android_log_print(ANDROID_LOG_INFO, kTag, "%s enter!", "init");
  if (clientCallback == nullptr) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "clientCallback IS NULL");
    return Void();
  }
  bool opened = false;
  {
    DeviceGate::Pass pass = gate().enter("init");
    if (!pass.ok()) return Void();
    // The cookie names the client: its death is told, so the channels it
    // opens need no looking after until then.
    const pid_t client = se_call::callerPid();
    Return<bool> linked =
        clientCallback->linkToDeath(sp<hidl_death_recipient>(this), static_cast<uint64_t>(client));
    if (linked.isOk() && static_cast<bool>(linked)) gate().linked(client);

    // Channels left open by a client that went away are closed once the eSE
    // says it is ready; channel 0 is the basic channel and never closed, nor
    // is a channel another client still holds.
    if (lib::readyStatus() == 0) {
      for (uint8_t c = 1; c < kTrackedChannels; ++c) {
        if (g_openedChannels[c].load() == 1 && !gate().heldByAnother(c, client) &&
            closeTracked(c, "internalCloseChannel") == CloseResult::kLibraryFailed) {
          closeLater(c, "init");
        }
      }
    }
    opened = lib::initOpen() == 0;
  }
  // The client hears of it with the library free: a slow client does not
  // hold up other callers.
  if (opened) {
    clientCallback->onStateChange(true);
  } else {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_init_open FAIL");
  }
  return Void();
}

Return<void> SecureElement::getAtr(getAtr_cb _hidl_cb) {
  __android_log_print(ANDROID_LOG_INFO, kTag, "%s enter!", "getAtr");
  _hidl_cb(hidl_vec<uint8_t>());
  return Void();
}

Return<bool> SecureElement::isCardPresent() {
  __android_log_print(ANDROID_LOG_INFO, kTag, "%s enter!", "isCardPresent");
  return true;
}

Return<void> SecureElement::transmit(const hidl_vec<uint8_t>& data, transmit_cb _hidl_cb) {
  static const char* const kOp = "transmit";
  DeviceGate::Pass pass = gate().enter(kOp);
  if (!pass.ok()) {
    _hidl_cb(hidl_vec<uint8_t>{kMarkerTransmitFailed});
    return Void();
  }
  __android_log_print(ANDROID_LOG_INFO, kTag, "%s enter!", kOp);

  std::vector<uint8_t> cmd(data.begin(), data.end());
  if (cmd.size() == 4) {
    // A case-1 command gets the Le byte a T=0 exchange expects; its header
    // stays as the caller wrote it.
    cmd.push_back(0x00);
  } else if (cmd.size() == kShortApduSize && cmd[1] == kInsGetResponse) {
    // GET RESPONSE keeps only the channel bits of its CLA.
    cmd[0] &= 0x03;
  }

  // A response is owed on every path: without one the client sees a broken
  // transport instead of a failed exchange.
  Buffer cmdBuf = allocBuffer(cmd.size(), false);
  if (!cmdBuf) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s cmdApdu.p_data malloc fail!", kOp);
    se_call::markFailed();
    _hidl_cb(hidl_vec<uint8_t>{kMarkerTransmitFailed});
    return Void();
  }
  if (!cmd.empty()) memcpy_s(cmdBuf.get(), cmd.size(), cmd.data(), cmd.size());
  Buffer rspBuf = allocBuffer(kRspBufSize, true);
  if (!rspBuf) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s rspApdu.p_data malloc fail!", kOp);
    se_call::markFailed();
    _hidl_cb(hidl_vec<uint8_t>{kMarkerTransmitFailed});
    return Void();
  }

  size_t rspLen = 0;
  const int32_t rc = transmitByIpc(cmdBuf.get(), cmd.size(), rspBuf.get(), &rspLen);
  hidl_vec<uint8_t> response;
  if (rc == 0) {
    response = bytesOf(rspBuf.get(), rspLen);
  } else {
    response = hidl_vec<uint8_t>{kMarkerTransmitFailed};
    __android_log_print(ANDROID_LOG_ERROR, kTag, "transmit failed!!!");
    se_call::markFailed();
    if (rspLen >= 2) response = bytesOf(rspBuf.get(), rspLen);
  }
  _hidl_cb(response);
  return Void();
}

Return<void> SecureElement::openLogicalChannel(const hidl_vec<uint8_t>& aid, uint8_t p2,
                                               openLogicalChannel_cb _hidl_cb) {
  static const char* const kOp = "openLogicalChannel";
  DeviceGate::Pass pass = gate().enter(kOp);
  if (!pass.ok()) {
    LogicalChannelResponse failed;
    failed.channelNumber = kMarkerExchangeFailed;
    _hidl_cb(failed, SecureElementStatus::FAILED);
    return Void();
  }
  __android_log_print(ANDROID_LOG_INFO, kTag, "%s enter!", kOp);

  LogicalChannelResponse result;
  result.channelNumber = 0;

  // Every way out delivers exactly one result, then does what follows it.
  auto deliver = [&](SecureElementStatus status) { _hidl_cb(result, status); };
  auto deliverUnassigned = [&](uint8_t marker, SecureElementStatus status) {
    result.channelNumber = marker;
    deliver(status);
    powerOff();
  };

  Buffer manageCmd = allocBuffer(kShortApduSize, true);
  if (!manageCmd) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s cmdApdu.p_data malloc fail!", kOp);
    deliver(SecureElementStatus::FAILED);
    failedSelectClose(kOp, 0);
    return Void();
  }
  Buffer manageRsp = allocBuffer(kRspBufSize, true);
  if (!manageRsp) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s rspApdu.p_data malloc fail!", kOp);
    deliver(SecureElementStatus::FAILED);
    failedSelectClose(kOp, 0);
    return Void();
  }

  if (lib::setReady() != 0) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Set_KORVA_READY failed!!!");
    deliverUnassigned(kMarkerNotReady, SecureElementStatus::IOERROR);
    return Void();
  }

  const uint8_t manageOpen[kShortApduSize] = {0x00, kInsManageChannel, 0x00, 0x00, 0x01};
  memcpy_s(manageCmd.get(), kShortApduSize, manageOpen, sizeof(manageOpen));
  size_t manageLen = 0;
  const int32_t manageRc =
      transmitByIpc(manageCmd.get(), kShortApduSize, manageRsp.get(), &manageLen);
  const uint8_t* manageBytes = manageRsp.get();
  const bool manageHasSw = manageLen >= 2;
  const uint8_t manageSw1 = manageHasSw ? manageBytes[manageLen - 2] : 0;
  const uint8_t manageSw2 = manageHasSw ? manageBytes[manageLen - 1] : 0;
  if (manageRc == 0) {
    __android_log_print(ANDROID_LOG_ERROR, kTag,
                        "%s OpenLogicalChannel 0700 command Respose value 0x%x%x", kOp, manageSw1,
                        manageSw2);
  }
  if (manageHasSw) result.selectResponse = bytesOf(manageBytes, manageLen);

  if (manageRc != 0) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Transmit_APDU_by_IPC failed!!!");
    deliverUnassigned(kMarkerExchangeFailed, SecureElementStatus::FAILED);
    return Void();
  }
  // A reply without a status word (empty or a single byte) is a refusal.
  if (!manageHasSw || !(manageSw1 == 0x90 && manageSw2 == 0x00)) {
    deliverUnassigned(kNoChannel, manageHasSw ? mapManageOpenSw(manageSw1, manageSw2)
                                              : SecureElementStatus::FAILED);
    return Void();
  }
  // 90 00 with no channel byte in front names no channel.
  if (manageLen < 3) {
    deliverUnassigned(kNoChannel, SecureElementStatus::FAILED);
    return Void();
  }
  const uint8_t channel = manageBytes[0];
  // Only channels 0..3 are coded by their number in CLA and fit the table; a
  // higher one is refused. It is closed on the card first, from the basic
  // channel with P2 naming it: left open, each refused open would use up one
  // more of the card's channels.
  if (!isTracked(channel)) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s card assigned channel %d, closing it", kOp,
                        channel);
    const CloseResult r = manageClose(0x00, channel, kOp);
    if (r != CloseResult::kClosed) {
      __android_log_print(ANDROID_LOG_ERROR, kTag, "%s close of channel %d failed", kOp, channel);
    }
    if (r == CloseResult::kLibraryFailed) {
      gate().defer([channel] { return outcomeOf(manageClose(0x00, channel, "openLogicalChannel")); },
                   "openLogicalChannel, close of refused channel " + std::to_string(channel),
                   channel);
    }
    deliverUnassigned(kNoChannel, SecureElementStatus::CHANNEL_NOT_AVAILABLE);
    return Void();
  }

  result.channelNumber = channel;
  g_openedChannels[channel].store(1);
  gate().opened(channel, se_call::callerPid());

  Buffer aidBuf = allocBuffer(aid.size(), true);
  if (!aidBuf) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s cpdu.pdata malloc fail!", kOp);
    deliver(SecureElementStatus::FAILED);
    return Void();
  }
  Buffer selectRsp = allocBuffer(kRspBufSize, true);
  if (!selectRsp) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s rpdu.pdata malloc fail!", kOp);
    deliver(SecureElementStatus::FAILED);
    return Void();
  }

  phQvEse_7816_cpdu cpdu;
  phQvEse_7816_rpdu rpdu;
  fillSelect(&cpdu, &rpdu, channel, p2 == 0x7F ? 0x00 : p2, aid, aidBuf.get(), selectRsp.get());

  SecureElementStatus status = SecureElementStatus::FAILED;
  if (lib::transceive(&cpdu, &rpdu) == 0) {
    result.selectResponse = dataAndSw(rpdu, kRspBufSize);
    __android_log_print(ANDROID_LOG_ERROR, kTag,
                        "%s OpenLogicalChannel Select AID response value 0x%x%x", kOp, rpdu.sw1,
                        rpdu.sw2);
    if (rpdu.sw1 == 0x61) {
      __android_log_print(ANDROID_LOG_INFO, kTag, "%s enter! 0x61", kOp);
      manageCmd.reset();
      manageRsp.reset();
      Buffer getCmd = allocBuffer(kShortApduSize, true);
      if (!getCmd) {
        __android_log_print(ANDROID_LOG_ERROR, kTag, "%s cmdApdu.p_data malloc fail!", kOp);
        deliver(SecureElementStatus::FAILED);
        return Void();
      }
      Buffer getRsp = allocBuffer(kRspBufSize, true);
      if (!getRsp) {
        __android_log_print(ANDROID_LOG_ERROR, kTag, "%s rspApdu.p_dataa malloc fail!", kOp);
        deliver(SecureElementStatus::FAILED);
        return Void();
      }
      const uint8_t getResponse[kShortApduSize] = {channel, kInsGetResponse, 0x00, 0x00, rpdu.sw2};
      memcpy_s(getCmd.get(), kShortApduSize, getResponse, sizeof(getResponse));
      size_t getLen = 0;
      if (transmitByIpc(getCmd.get(), kShortApduSize, getRsp.get(), &getLen) == 0) {
        result.selectResponse = bytesOf(getRsp.get(), getLen);
        if (getLen >= 2) {
          const uint8_t sw1 = getRsp.get()[getLen - 2];
          const uint8_t sw2 = getRsp.get()[getLen - 1];
          __android_log_print(ANDROID_LOG_ERROR, kTag, "%s enter! 0x%x%x", kOp, sw1, sw2);
          status = mapGetResponseSw(sw1, sw2, false);
        }
      }
    } else {
      status = mapSelectSw(rpdu.sw1, rpdu.sw2);
    }
  }

  deliver(status);
  if (status != SecureElementStatus::SUCCESS) failedSelectClose(kOp, channel);
  return Void();
}

Return<void> SecureElement::openBasicChannel(const hidl_vec<uint8_t>& aid, uint8_t p2,
                                             openBasicChannel_cb _hidl_cb) {
  static const char* const kOp = "openBasicChannel";
  __android_log_print(ANDROID_LOG_INFO, kTag, "%s enter!", kOp);
  DeviceGate::Pass pass = gate().enter(kOp);
  if (!pass.ok()) {
    _hidl_cb(hidl_vec<uint8_t>{kMarkerExchangeFailed}, SecureElementStatus::FAILED);
    return Void();
  }

  hidl_vec<uint8_t> response;
  Buffer aidBuf = allocBuffer(aid.size(), true);
  if (!aidBuf) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s cpdu.pdata malloc fail!", kOp);
    _hidl_cb(response, SecureElementStatus::FAILED);
    return Void();
  }
  Buffer selectRsp = allocBuffer(kBasicSelectRspBufSize, false);
  if (!selectRsp) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s rpdu.pdata malloc fail!", kOp);
    _hidl_cb(response, SecureElementStatus::FAILED);
    return Void();
  }

  if (lib::setReady() != 0) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Set_KORVA_READY failed!!!");
    _hidl_cb(hidl_vec<uint8_t>{kMarkerNotReady}, SecureElementStatus::IOERROR);
    powerOff();
    return Void();
  }

  phQvEse_7816_cpdu cpdu;
  phQvEse_7816_rpdu rpdu;
  fillSelect(&cpdu, &rpdu, 0x00, p2, aid, aidBuf.get(), selectRsp.get());

  SecureElementStatus status = SecureElementStatus::FAILED;
  if (lib::transceive(&cpdu, &rpdu) != 0) {
    const bool swSaysNothing = (rpdu.sw1 == 0x00 || rpdu.sw1 == 0x90) && rpdu.sw2 == 0x00;
    response = swSaysNothing ? hidl_vec<uint8_t>{kMarkerExchangeFailed}
                             : hidl_vec<uint8_t>{kMarkerExchangeFailed, rpdu.sw1, rpdu.sw2};
  } else {
    response = dataAndSw(rpdu, kBasicSelectRspBufSize);
    __android_log_print(ANDROID_LOG_ERROR, kTag,
                        "%s OpenBasicChannel Select AID response value 0x%x%x", kOp, rpdu.sw1,
                        rpdu.sw2);
    if (rpdu.sw1 == 0x61) {
      __android_log_print(ANDROID_LOG_INFO, kTag, "%s enter! 0x61", kOp);
      Buffer getCmd = allocBuffer(kShortApduSize, true);
      if (!getCmd) {
        __android_log_print(ANDROID_LOG_ERROR, kTag, "%s cmdApdu.p_data malloc fail!", kOp);
        _hidl_cb(response, SecureElementStatus::FAILED);
        return Void();
      }
      Buffer getRsp = allocBuffer(kRspBufSize, true);
      if (!getRsp) {
        __android_log_print(ANDROID_LOG_ERROR, kTag, "%s rspApdu.p_data malloc fail!", kOp);
        _hidl_cb(response, SecureElementStatus::FAILED);
        return Void();
      }
      const uint8_t getResponse[kShortApduSize] = {0x00, kInsGetResponse, 0x00, 0x00, rpdu.sw2};
      memcpy_s(getCmd.get(), kShortApduSize, getResponse, sizeof(getResponse));
      size_t getLen = 0;
      const int32_t rc = transmitByIpc(getCmd.get(), kShortApduSize, getRsp.get(), &getLen);
      const uint8_t* bytes = getRsp.get();
      if (rc != 0) {
        std::vector<uint8_t> marked{kMarkerExchangeFailed};
        if (getLen >= 2) {
          marked.push_back(bytes[getLen - 2]);
          marked.push_back(bytes[getLen - 1]);
        }
        response = hidl_vec<uint8_t>(std::move(marked));
      } else {
        response = bytesOf(bytes, getLen);
        if (getLen >= 2) {
          __android_log_print(ANDROID_LOG_INFO, kTag, "%s enter! 0x%x%x", kOp, bytes[getLen - 2],
                              bytes[getLen - 1]);
          status = mapGetResponseSw(bytes[getLen - 2], bytes[getLen - 1], true);
        }
      }
    } else {
      status = mapSelectSw(rpdu.sw1, rpdu.sw2);
    }
  }

  _hidl_cb(response, status);
  if (status != SecureElementStatus::SUCCESS) powerOff();
  return Void();
}

Return<SecureElementStatus> SecureElement::closeChannel(uint8_t channelNumber) {
  static const char* const kOp = "closeChannel";
  // Only a channel this front opened is owed a close once the caller lets go
  // of it: the caller learns that it was not closed now, and it is closed as
  // soon as the library can.
  const bool owed = isLogicalChannelOpen(channelNumber);
  DeviceGate::Pass pass = gate().enter(kOp);
  if (!pass.ok()) {
    if (owed) closeLater(channelNumber, kOp);
    return SecureElementStatus::FAILED;
  }
  const CloseResult r = closeTracked(channelNumber, kOp);
  if (r == CloseResult::kLibraryFailed && owed) closeLater(channelNumber, kOp);
  return statusOf(r);
}

SecureElementStatus SecureElement::internalCloseChannel(uint8_t channelNumber) {
  return statusOf(closeTracked(channelNumber, "internalCloseChannel"));
}

bool SecureElement::releaseLibrary(const char* op) {
  // The card drops every channel with the close: nothing owed to them is
  // left to send, and their flags go at the next init's sweep.
  auto release = [] {
    (void)lib::close();
    gate().forgetChannels();
    return DeviceGate::Outcome::kDone;
  };
  DeviceGate::Pass pass = gate().enter(op);
  if (!pass.ok()) {
    gate().defer(release, std::string(op) + ", phQvEse_close");
    return false;
  }
  release();
  return true;
}

bool SecureElement::isLogicalChannelOpen(uint8_t channelNumber) {
  return channelNumber != 0 && isTracked(channelNumber) &&
         g_openedChannels[channelNumber].load() == 1;
}

void SecureElement::serviceDied(uint64_t cookie, const wp<IBase>& /*who*/) {
  __android_log_print(ANDROID_LOG_ERROR, kTag, "%s enter!", "serviceDied");
  // Death notices come on a pool thread; one must not wait behind a library
  // call that may never return: the close runs as soon as the library is
  // free, before any later call.
  gate().defer(
      [] {
        (void)lib::close();
        gate().forgetChannels();
        return DeviceGate::Outcome::kDone;
      },
      "serviceDied, phQvEse_close");
  // Its channels went with the close; the client is no longer linked.
  if (cookie != 0) gate().clientDied(static_cast<pid_t>(cookie));
}

}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

// The vendor eSE library over PC/SC: whatever card pcscd offers (a JavaCard
// in a USB reader, an eSE board with a CCID interface, the virtual card of
// card-vpcd) stands behind the functions of ese_qv_hal.h.
//
// Properties, read at each call:
//   vendor.ese_pcsc.type    eSE type reported by get_korva_exist_flag (default 1)
//   vendor.ese_pcsc.reader  part of the reader's name to use; unset: the first
//                           reader that holds a card
//
// Every function runs under one lock: the daemon calls init and close
// outside its own eSE lock.
#include "ese_qv_hal.h"

#include <android/log.h>
#include <cutils/properties.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>
#include <vector>

#include "pcsc_link.h"

int32_t g_korva_exist = 0;

namespace {

using ese_pcsc::kTag;

// The caller's buffers: 270 bytes for a whole IPC response, 256 data bytes
// for a Transceive response (the basic channel's SELECT buffer).
constexpr size_t kIpcResponseBuffer = 270;
constexpr size_t kRpduDataBuffer = 256;
constexpr uint32_t kApduHeader = 4;

std::string propertyText(const char* name) {
  char value[PROPERTY_VALUE_MAX] = {0};
  property_get(name, value, "");
  return value;
}

struct Library {
  std::mutex lock;
  ese_pcsc::PcscLink link;
};

// Lives as long as the process: a daemon thread may still call in while the
// process exits.
Library& library() {
  static Library* instance = new Library;
  return *instance;
}

}  // namespace

extern "C" int32_t get_korva_exist_flag(void) {
  const std::string v = propertyText("vendor.ese_pcsc.type");
  int32_t type = 1;
  if (!v.empty()) {
    char* end = nullptr;
    errno = 0;
    const long n = strtol(v.c_str(), &end, 0);
    if (errno != 0 || end == v.c_str() || *end != '\0' || n < INT32_MIN || n > INT32_MAX) {
      __android_log_print(ANDROID_LOG_ERROR, kTag, "property vendor.ese_pcsc.type=\"%s\" is not a number, using 1",
                          v.c_str());
    } else {
      type = static_cast<int32_t>(n);
    }
  }
  __android_log_print(ANDROID_LOG_INFO, kTag, "get_korva_exist_flag: %d", type);
  return type;
}

extern "C" int32_t phQvEse_init_open(void) {
  Library& l = library();
  std::lock_guard<std::mutex> guard(l.lock);
  return l.link.open(propertyText("vendor.ese_pcsc.reader")) ? 0 : -1;
}

extern "C" int32_t phQvEse_close(void) {
  Library& l = library();
  std::lock_guard<std::mutex> guard(l.lock);
  if (!l.link.isOpen()) __android_log_print(ANDROID_LOG_DEBUG, kTag, "phQvEse_close: not connected");
  l.link.close();
  return 0;
}

extern "C" int32_t phQvEse_7816_Transceive(phQvEse_7816_cpdu* cpdu, phQvEse_7816_rpdu* rpdu) {
  if (cpdu == nullptr || rpdu == nullptr) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_7816_Transceive: null record");
    return -1;
  }
  rpdu->len = 0;
  rpdu->sw1 = 0;
  rpdu->sw2 = 0;
  // Short APDUs only: Lc up to 255, Le up to 256 (sent as 00).
  if (cpdu->lc > 255 || (cpdu->lc > 0 && cpdu->pdata == nullptr) ||
      (cpdu->le_type == 1 && (cpdu->le == 0 || cpdu->le > 256))) {
    __android_log_print(ANDROID_LOG_ERROR, kTag,
                        "phQvEse_7816_Transceive: bad command record (lc %u, le_type %u, le %u)", cpdu->lc,
                        cpdu->le_type, cpdu->le);
    return -1;
  }
  std::vector<uint8_t> apdu = {cpdu->cla, cpdu->ins, cpdu->p1, cpdu->p2};
  if (cpdu->lc > 0) {
    apdu.push_back(static_cast<uint8_t>(cpdu->lc));
    apdu.insert(apdu.end(), cpdu->pdata, cpdu->pdata + cpdu->lc);
  }
  if (cpdu->le_type == 1) apdu.push_back(cpdu->le == 256 ? 0 : static_cast<uint8_t>(cpdu->le));

  Library& l = library();
  std::lock_guard<std::mutex> guard(l.lock);
  std::vector<uint8_t> r;
  if (!l.link.transmit("phQvEse_7816_Transceive", apdu.data(), apdu.size(), &r)) return -1;
  if (r.size() < 2) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_7816_Transceive: %zu-byte answer holds no status word",
                        r.size());
    return -1;
  }
  const size_t dataLen = r.size() - 2;
  rpdu->sw1 = r[dataLen];
  rpdu->sw2 = r[dataLen + 1];
  if (dataLen > kRpduDataBuffer || (dataLen > 0 && rpdu->pdata == nullptr)) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_7816_Transceive: %zu data bytes do not fit the buffer",
                        dataLen);
    return -1;
  }
  if (dataLen > 0) memcpy(rpdu->pdata, r.data(), dataLen);
  rpdu->len = static_cast<uint16_t>(dataLen);
  return 0;
}

extern "C" int32_t phQVNciHal_Transmit_APDU_by_IPC(phQvEse_data* cmd, phQvEse_data* rsp) {
  if (cmd == nullptr || rsp == nullptr) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Transmit_APDU_by_IPC: null record");
    return -1;
  }
  rsp->len = 0;
  if ((cmd->len > 0 && cmd->p_data == nullptr) || rsp->p_data == nullptr) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Transmit_APDU_by_IPC: null buffer");
    return -1;
  }
  if (cmd->len < kApduHeader) {
    // No APDU at all; some reader drivers never answer one (vpcd reads a
    // single byte as a power command and stalls the reader on none).
    __android_log_print(ANDROID_LOG_ERROR, kTag,
                        "phQVNciHal_Transmit_APDU_by_IPC: %u-byte command is shorter than an APDU header, not sent",
                        cmd->len);
    return -1;
  }
  Library& l = library();
  std::lock_guard<std::mutex> guard(l.lock);
  std::vector<uint8_t> r;
  if (!l.link.transmit("phQVNciHal_Transmit_APDU_by_IPC", cmd->p_data, cmd->len, &r)) return -1;
  if (r.size() > kIpcResponseBuffer) {
    __android_log_print(ANDROID_LOG_ERROR, kTag,
                        "phQVNciHal_Transmit_APDU_by_IPC: %zu response bytes do not fit the %zu-byte buffer",
                        r.size(), kIpcResponseBuffer);
    return -1;
  }
  // A T=0 card's 61 xx and 6C xx go back as they are: the caller fetches.
  if (!r.empty()) memcpy(rsp->p_data, r.data(), r.size());
  rsp->len = static_cast<uint32_t>(r.size());
  return 0;
}

extern "C" int32_t phQVNciHal_Set_KORVA_READY(void) {
  Library& l = library();
  std::lock_guard<std::mutex> guard(l.lock);
  return l.link.ready() ? 0 : -1;
}

extern "C" int32_t phQVNciHal_Set_KORVA_Power(const char* state) {
  // Powering the card down would close every logical channel, and the
  // daemon asks this after each close with others still open: PC/SC's power
  // control is kept for phQvEse_close.
  __android_log_print(ANDROID_LOG_DEBUG, kTag, "phQVNciHal_Set_KORVA_Power: %s: nothing to do over PC/SC",
                      state != nullptr ? state : "(null)");
  return 0;
}

extern "C" int32_t phQVNciHal_Get_KORVA_Ready_Status(void) {
  Library& l = library();
  std::lock_guard<std::mutex> guard(l.lock);
  // Channels left by an earlier client are worth closing only while the
  // card still holds them: while connected. A closed connection powered the
  // card down, and they went with it.
  const int32_t status = l.link.isOpen() ? 0 : 1;
  __android_log_print(ANDROID_LOG_DEBUG, kTag, "phQVNciHal_Get_KORVA_Ready_Status: %d (%s)", status,
                      status == 0 ? "connected" : "not connected");
  return status;
}

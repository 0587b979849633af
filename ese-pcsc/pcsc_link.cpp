#include "pcsc_link.h"

#include <android/log.h>
#include <reader.h>

#include <cstdio>
#include <cstring>

namespace ese_pcsc {

const char* const kTag = "ese_pcsc";

namespace {

std::string hex(const uint8_t* p, size_t n) {
  static const char kDigits[] = "0123456789ABCDEF";
  std::string s;
  for (size_t i = 0; i < n; ++i) {
    s.push_back(kDigits[p[i] >> 4]);
    s.push_back(kDigits[p[i] & 0x0F]);
  }
  return s;
}

// Errors after which the handle is of no more use: the card, the reader or
// pcscd itself is gone.
bool connectionGone(LONG rv) {
  switch (rv) {
    case SCARD_W_REMOVED_CARD:
    case SCARD_E_NO_SMARTCARD:
    case SCARD_W_UNPOWERED_CARD:
    case SCARD_W_UNRESPONSIVE_CARD:
    case SCARD_E_READER_UNAVAILABLE:
    case SCARD_E_UNKNOWN_READER:
    case SCARD_E_NO_SERVICE:
    case SCARD_E_SERVICE_STOPPED:
    case SCARD_F_COMM_ERROR:
    case SCARD_E_INVALID_HANDLE:
      return true;
    default:
      return false;
  }
}

bool noDaemon(LONG rv) { return rv == SCARD_E_NO_SERVICE || rv == SCARD_F_COMM_ERROR || rv == SCARD_E_SERVICE_STOPPED; }

int protocolNumber(DWORD p) { return p == SCARD_PROTOCOL_T1 ? 1 : p == SCARD_PROTOCOL_T0 ? 0 : -1; }

}  // namespace

PcscLink::~PcscLink() { close(); }

bool PcscLink::establish(const char* who) {
  if (haveContext_) {
    const LONG valid = SCardIsValidContext(context_);
    if (valid == SCARD_S_SUCCESS) return true;
    __android_log_print(ANDROID_LOG_DEBUG, kTag, "SCardIsValidContext: %s; a new context", pcsc_stringify_error(valid));
    release();
  }
  const LONG rv = SCardEstablishContext(SCARD_SCOPE_SYSTEM, nullptr, nullptr, &context_);
  if (rv != SCARD_S_SUCCESS) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s: %s (SCardEstablishContext: %s)", who,
                        noDaemon(rv) ? "no pcscd" : "cannot reach pcscd", pcsc_stringify_error(rv));
    return false;
  }
  haveContext_ = true;
  return true;
}

bool PcscLink::chooseReader(const std::string& wanted, std::string* chosen) {
  DWORD size = 0;
  LONG rv = SCardListReaders(context_, nullptr, nullptr, &size);
  std::vector<char> names;
  if (rv == SCARD_S_SUCCESS) {
    names.resize(size + 1, '\0');
    rv = SCardListReaders(context_, nullptr, names.data(), &size);
  }
  if (rv != SCARD_S_SUCCESS) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_init_open: %s (SCardListReaders: %s)",
                        rv == SCARD_E_NO_READERS_AVAILABLE ? "no reader" : noDaemon(rv) ? "no pcscd" : "no reader list",
                        pcsc_stringify_error(rv));
    if (noDaemon(rv)) release();
    return false;
  }
  std::vector<SCARD_READERSTATE> states;
  std::string all;
  for (const char* p = names.data(); *p != '\0'; p += strlen(p) + 1) {
    all += (all.empty() ? "\"" : ", \"") + std::string(p) + "\"";
    if (!wanted.empty() && strstr(p, wanted.c_str()) == nullptr) continue;
    SCARD_READERSTATE s{};
    s.szReader = p;
    s.dwCurrentState = SCARD_STATE_UNAWARE;
    states.push_back(s);
  }
  if (states.empty()) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_init_open: no reader matching \"%s\" (readers: %s)",
                        wanted.c_str(), all.c_str());
    return false;
  }
  rv = SCardGetStatusChange(context_, 0, states.data(), static_cast<DWORD>(states.size()));
  if (rv != SCARD_S_SUCCESS) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_init_open: %s (SCardGetStatusChange: %s)",
                        noDaemon(rv) ? "no pcscd" : "no reader state", pcsc_stringify_error(rv));
    if (noDaemon(rv)) release();
    return false;
  }
  for (const SCARD_READERSTATE& s : states) {
    if ((s.dwEventState & SCARD_STATE_PRESENT) != 0 && (s.dwEventState & SCARD_STATE_MUTE) == 0) {
      *chosen = s.szReader;
      return true;
    }
  }
  if (wanted.empty()) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_init_open: no card in any reader (readers: %s)",
                        all.c_str());
  } else {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_init_open: no card in the reader matching \"%s\" (readers: %s)",
                        wanted.c_str(), all.c_str());
  }
  return false;
}

bool PcscLink::connect(const std::string& name) {
  DWORD protocol = 0;
  const LONG rv = SCardConnect(context_, name.c_str(), SCARD_SHARE_SHARED, SCARD_PROTOCOL_T0 | SCARD_PROTOCOL_T1,
                               &card_, &protocol);
  if (rv != SCARD_S_SUCCESS) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_init_open: %s \"%s\" (SCardConnect: %s)",
                        rv == SCARD_E_NO_SMARTCARD || rv == SCARD_W_REMOVED_CARD ? "no card in" : "cannot connect to",
                        name.c_str(), pcsc_stringify_error(rv));
    if (noDaemon(rv)) release();
    return false;
  }
  connected_ = true;
  protocol_ = protocol;
  reader_ = name;
  uint8_t atr[MAX_ATR_SIZE];
  DWORD atrLen = sizeof(atr), state = 0, nameLen = 0;
  const LONG status = SCardStatus(card_, nullptr, &nameLen, &state, &protocol, atr, &atrLen);
  if (status != SCARD_S_SUCCESS) {
    __android_log_print(ANDROID_LOG_DEBUG, kTag, "SCardStatus for the ATR: %s", pcsc_stringify_error(status));
    atrLen = 0;
  }
  __android_log_print(ANDROID_LOG_INFO, kTag, "phQvEse_init_open: connected to \"%s\", T=%d, ATR %s", name.c_str(),
                      protocolNumber(protocol), hex(atr, atrLen).c_str());
  return true;
}

bool PcscLink::alive() {
  if (!connected_) return false;
  DWORD state = 0, protocol = 0, atrLen = MAX_ATR_SIZE, nameLen = 0;
  uint8_t atr[MAX_ATR_SIZE];
  LONG rv = SCardStatus(card_, nullptr, &nameLen, &state, &protocol, atr, &atrLen);
  if (rv == SCARD_W_RESET_CARD) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "the card in \"%s\" was reset by another application: its logical channels are gone",
                        reader_.c_str());
    rv = SCardReconnect(card_, SCARD_SHARE_SHARED, SCARD_PROTOCOL_T0 | SCARD_PROTOCOL_T1, SCARD_LEAVE_CARD, &protocol_);
    if (rv != SCARD_S_SUCCESS) {
      drop("SCardReconnect", rv);
      return false;
    }
    return true;
  }
  if (rv != SCARD_S_SUCCESS) {
    drop("SCardStatus", rv);
    return false;
  }
  return true;
}

bool PcscLink::open(const std::string& wanted) {
  if (connected_) {
    if ((wanted.empty() || reader_.find(wanted) != std::string::npos) && alive()) {
      __android_log_print(ANDROID_LOG_INFO, kTag, "phQvEse_init_open: still connected to \"%s\"", reader_.c_str());
      return true;
    }
    close();
  }
  if (!establish("phQvEse_init_open")) return false;
  std::string name;
  if (!chooseReader(wanted, &name)) return false;
  return connect(name);
}

void PcscLink::close() {
  if (connected_) {
    const LONG rv = SCardDisconnect(card_, SCARD_UNPOWER_CARD);
    if (rv == SCARD_S_SUCCESS) {
      __android_log_print(ANDROID_LOG_INFO, kTag, "phQvEse_close: disconnected from \"%s\", card powered down",
                          reader_.c_str());
    } else {
      __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_close: SCardDisconnect on \"%s\": %s", reader_.c_str(),
                          pcsc_stringify_error(rv));
    }
    connected_ = false;
  }
  release();
}

void PcscLink::release() {
  if (haveContext_) {
    const LONG rv = SCardReleaseContext(context_);
    if (rv != SCARD_S_SUCCESS && rv != SCARD_E_INVALID_HANDLE) {
      __android_log_print(ANDROID_LOG_DEBUG, kTag, "SCardReleaseContext: %s", pcsc_stringify_error(rv));
    }
    haveContext_ = false;
  }
}

void PcscLink::drop(const char* who, LONG rv) {
  __android_log_print(ANDROID_LOG_ERROR, kTag, "%s on \"%s\": %s; connection dropped, the next init connects again",
                      who, reader_.c_str(), pcsc_stringify_error(rv));
  const LONG left = SCardDisconnect(card_, SCARD_LEAVE_CARD);
  if (left != SCARD_S_SUCCESS) {
    __android_log_print(ANDROID_LOG_DEBUG, kTag, "SCardDisconnect of the lost handle: %s", pcsc_stringify_error(left));
  }
  connected_ = false;
  release();
}

bool PcscLink::ready() {
  if (!connected_) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Set_KORVA_READY: not connected to a card");
    return false;
  }
  return alive();
}

bool PcscLink::transmit(const char* who, const uint8_t* cmd, size_t len, std::vector<uint8_t>* resp) {
  resp->clear();
  if (!connected_) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s: not connected to a card", who);
    return false;
  }
  if (rxBuffer_.empty()) rxBuffer_.resize(MAX_BUFFER_SIZE_EXTENDED);
  DWORD rxLen = static_cast<DWORD>(rxBuffer_.size());
  const SCARD_IO_REQUEST* pci = protocol_ == SCARD_PROTOCOL_T1 ? SCARD_PCI_T1 : SCARD_PCI_T0;
  const LONG rv = SCardTransmit(card_, pci, cmd, static_cast<DWORD>(len), nullptr, rxBuffer_.data(), &rxLen);
  if (rv == SCARD_S_SUCCESS) {
    resp->assign(rxBuffer_.begin(), rxBuffer_.begin() + static_cast<std::ptrdiff_t>(rxLen));
    return true;
  }
  const std::string what = std::string(who) + ": SCardTransmit";
  if (connectionGone(rv)) {
    drop(what.c_str(), rv);
  } else if (rv == SCARD_W_RESET_CARD) {
    alive();  // reconnects; this exchange still failed
  } else {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "%s of %zu bytes: %s", what.c_str(), len, pcsc_stringify_error(rv));
  }
  return false;
}

}  // namespace ese_pcsc

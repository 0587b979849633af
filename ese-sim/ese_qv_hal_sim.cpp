// Simulated vendor eSE library: a virtual secure element behind the seven
// functions of ese_qv_hal.h.
//
// Properties, read at each call so that a running daemon can be driven:
//   vendor.ese_sim.type          eSE type reported by get_korva_exist_flag (default 1)
//   vendor.ese_sim.fail_ready    1: phQVNciHal_Set_KORVA_READY fails
//   vendor.ese_sim.fail_open     1: phQvEse_init_open fails
//   vendor.ese_sim.fail_exchange 1: both exchanges fail and hand back no status;
//                                four hex digits (e.g. 6A82): they fail and
//                                leave that status word in the response
//   vendor.ese_sim.ready_status  what phQVNciHal_Get_KORVA_Ready_Status returns (default 0)
//   vendor.ese_sim.channels      channels of the card, basic included (1 to 20,
//                                default 4), taken when the eSE is opened from
//                                the closed state
//   vendor.ese_sim.min_channel   the lowest channel number MANAGE CHANNEL open
//                                assigns (default 1); 4 or more hands out
//                                channels the daemon cannot serve (with
//                                vendor.ese_sim.channels above 4)
//   vendor.ese_sim.hang_exchange 1: both exchanges hang, holding the library's
//                                lock (so open and close wait too), until the
//                                property is cleared; "hanging" and "released"
//                                are logged
//   vendor.ese_sim.slow_p1       a hex byte (e.g. 42): an exchange, by either
//   vendor.ese_sim.slow_ms       function, whose P1 equals it takes slow_ms
//                                milliseconds before the card answers, as a
//                                card busy generating a key; the library's
//                                lock is held meanwhile, as for any exchange,
//                                and the start of the wait is logged
// Flags take 1, true, yes or on.
//
// Open channels report: whenever the set of the card's open logical channels
// changes, the library rewrites $SE_DEVICE_ROOT/data/vendor/ese_sim/open_channels
// with one line, the open channel numbers in ascending order separated by
// blanks, the basic channel not listed (an empty line: none open), and logs
// "open channels: ...".
//
// The eSE is closed when the library loads. Exchanges fail (-1, no bytes)
// until phQvEse_init_open succeeds and again after phQvEse_close, which also
// power-cycles the card: every logical channel is closed. The "korva_poweroff"
// request is only logged: the daemon asks it after every close even with
// other channels still open, so it must not drop them.
//
// Never more is written than the caller's buffers hold: at most 256 data
// bytes into a Transceive response (the basic channel's SELECT buffer is 256)
// and at most 258 bytes (256 data + SW1 SW2) into an IPC response (buffer 270).
#include "ese_qv_hal.h"

#include <android/log.h>
#include <cutils/properties.h>

#include <host/device_root.h>
#include <stdio.h>
#include <sys/stat.h>
#include <time.h>

#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>
#include <vector>

#include "status_words.h"
#include "virtual_card.h"

int32_t g_korva_exist = 0;

namespace {

const char* const kTag = "ese_sim";
constexpr size_t kMaxRpduData = 256;
constexpr size_t kMaxIpcResponse = 258;
// Largest short APDU: header, Lc, 255 data bytes, Le.
constexpr size_t kMaxShortCommand = 4 + 1 + 255 + 1;
constexpr int kDefaultChannels = 4;

std::string propertyText(const char* name) {
  char value[PROPERTY_VALUE_MAX] = {0};
  property_get(name, value, "");
  return value;
}

bool propertyFlag(const char* name) {
  std::string v = propertyText(name);
  for (char& c : v) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
  return v == "1" || v == "true" || v == "yes" || v == "on";
}

int32_t propertyInt(const char* name, int32_t fallback) {
  const std::string v = propertyText(name);
  if (v.empty()) return fallback;
  char* end = nullptr;
  errno = 0;
  long n = strtol(v.c_str(), &end, 0);
  if (errno != 0 || end == v.c_str() || *end != '\0' || n < INT32_MIN || n > INT32_MAX) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "property %s=\"%s\" is not a number, using %d", name, v.c_str(),
                        fallback);
    return fallback;
  }
  return static_cast<int32_t>(n);
}

struct ExchangeFault {
  bool fail = false;
  bool hasSw = false;
  uint16_t sw = 0;
};

ExchangeFault exchangeFault() {
  ExchangeFault f;
  const std::string v = propertyText("vendor.ese_sim.fail_exchange");
  if (v.size() == 4 && isxdigit(static_cast<unsigned char>(v[0])) && isxdigit(static_cast<unsigned char>(v[1])) &&
      isxdigit(static_cast<unsigned char>(v[2])) && isxdigit(static_cast<unsigned char>(v[3]))) {
    f.fail = f.hasSw = true;
    f.sw = static_cast<uint16_t>(strtoul(v.c_str(), nullptr, 16));
    return f;
  }
  f.fail = propertyFlag("vendor.ese_sim.fail_exchange");
  return f;
}

std::string hex(const uint8_t* p, size_t n) {
  static const char kDigits[] = "0123456789ABCDEF";
  std::string s;
  s.reserve(2 * n);
  for (size_t i = 0; i < n; ++i) {
    s.push_back(kDigits[p[i] >> 4]);
    s.push_back(kDigits[p[i] & 0x0F]);
  }
  return s;
}

uint16_t statusOf(const std::vector<uint8_t>& r) { return static_cast<uint16_t>((r[r.size() - 2] << 8) | r.back()); }

struct Ese {
  std::mutex lock;
  bool opened = false;
  int channels = kDefaultChannels;
  se_card::VirtualCard card{se_card::CardOptions{kDefaultChannels, {}}};
  // The open channel line last written, and where (tests change the root).
  std::string reported;
  std::string reportedTo;
};

// Lives as long as the process: a daemon thread may still call in while the
// process exits.
Ese& ese() {
  static Ese* instance = new Ese;
  return *instance;
}

std::string reportDir() { return android::host::mapDevicePath("/data/vendor/ese_sim"); }

// Folders on the way are made as needed; the file is replaced whole, so that
// a reader never sees half a line.
void writeReport(const std::string& dir, const std::string& line) {
  std::string made;
  for (size_t at = 0; at != std::string::npos;) {
    at = dir.find('/', at + 1);
    made = dir.substr(0, at);
    if (!made.empty()) mkdir(made.c_str(), 0755);
  }
  const std::string path = dir + "/open_channels";
  const std::string tmp = path + ".new";
  FILE* f = fopen(tmp.c_str(), "w");
  if (f == nullptr) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "cannot write %s: %s", tmp.c_str(), strerror(errno));
    return;
  }
  fprintf(f, "%s\n", line.c_str());
  fclose(f);
  rename(tmp.c_str(), path.c_str());
}

// Called with the lock held after anything that may open or close channels.
void reportOpenChannels(Ese& e) {
  std::string line;
  for (int c = 1; c < e.card.channelCount(); ++c) {
    if (!e.card.isChannelOpen(c)) continue;
    if (!line.empty()) line += ' ';
    line += std::to_string(c);
  }
  const std::string dir = reportDir();
  if (line == e.reported && dir == e.reportedTo) return;
  e.reported = line;
  e.reportedTo = dir;
  __android_log_print(ANDROID_LOG_INFO, kTag, "open channels: %s", line.c_str());
  writeReport(dir, line);
}

// MANAGE CHANNEL open with the card choosing (P2 00): assigns the lowest free
// channel from vendor.ese_sim.min_channel on by opening it by number.
bool isAssigningOpen(const std::vector<uint8_t>& apdu) {
  return apdu.size() >= 4 && apdu[1] == 0x70 && apdu[2] == 0x00 && apdu[3] == 0x00;
}

std::vector<uint8_t> openFrom(Ese& e, const std::vector<uint8_t>& apdu, int first) {
  for (int c = first; c < e.card.channelCount(); ++c) {
    if (e.card.isChannelOpen(c)) continue;
    std::vector<uint8_t> byNumber = {apdu[0], 0x70, 0x00, static_cast<uint8_t>(c)};
    std::vector<uint8_t> r = e.card.process(byNumber);
    if (statusOf(r) != se_card::SW_OK) return r;
    return {static_cast<uint8_t>(c), 0x90, 0x00};
  }
  return {0x6A, 0x81};
}

// While vendor.ese_sim.hang_exchange is set, the call does not return; the
// property is looked at again every 20 ms.
void hangWhileAsked(const char* fn) {
  if (!propertyFlag("vendor.ese_sim.hang_exchange")) return;
  __android_log_print(ANDROID_LOG_ERROR, kTag, "%s: hanging (vendor.ese_sim.hang_exchange)", fn);
  while (propertyFlag("vendor.ese_sim.hang_exchange")) {
    struct timespec ts = {0, 20 * 1000000L};
    nanosleep(&ts, nullptr);
  }
  __android_log_print(ANDROID_LOG_ERROR, kTag, "%s: released", fn);
}

// P1 as vendor.ese_sim.slow_p1 names it: one or two hex digits, "0x" allowed.
// -1 when unset or not a byte.
int slowP1() {
  const std::string v = propertyText("vendor.ese_sim.slow_p1");
  if (v.empty()) return -1;
  char* end = nullptr;
  const unsigned long n = strtoul(v.c_str(), &end, 16);
  if (end == v.c_str() || *end != '\0' || n > 0xFF || v[0] == '-' || v[0] == '+') {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "property vendor.ese_sim.slow_p1=\"%s\" is not a hex byte", v.c_str());
    return -1;
  }
  return static_cast<int>(n);
}

// A healthy but long command: the card answers only after
// vendor.ese_sim.slow_ms milliseconds, measured on the monotonic clock.
void slowIfAsked(const std::vector<uint8_t>& apdu, const char* route) {
  if (apdu.size() < 4) return;
  const int p1 = slowP1();
  if (p1 < 0 || apdu[2] != p1) return;
  const int32_t ms = propertyInt("vendor.ese_sim.slow_ms", 0);
  if (ms <= 0) return;
  __android_log_print(ANDROID_LOG_INFO, kTag, "%s: slow command (P1 %02X), answering in %d ms", route, p1,
                      static_cast<int>(ms));
  struct timespec until;
  clock_gettime(CLOCK_MONOTONIC, &until);
  until.tv_sec += ms / 1000;
  until.tv_nsec += (ms % 1000) * 1000000L;
  if (until.tv_nsec >= 1000000000L) {
    until.tv_sec += 1;
    until.tv_nsec -= 1000000000L;
  }
  while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &until, nullptr) == EINTR) {
  }
}

std::vector<uint8_t> exchange(Ese& e, const std::vector<uint8_t>& apdu, const char* route) {
  slowIfAsked(apdu, route);
  const int first = isAssigningOpen(apdu) ? propertyInt("vendor.ese_sim.min_channel", 1) : 1;
  std::vector<uint8_t> r = first > 1 ? openFrom(e, apdu, first) : e.card.process(apdu);
  reportOpenChannels(e);
  __android_log_print(ANDROID_LOG_DEBUG, kTag, "%s > %s", route, hex(apdu.data(), apdu.size()).c_str());
  __android_log_print(ANDROID_LOG_DEBUG, kTag, "%s < %s (%s)", route, hex(r.data(), r.size()).c_str(),
                      se_card::statusWordName(statusOf(r)).c_str());
  return r;
}

}  // namespace

extern "C" int32_t get_korva_exist_flag(void) {
  int32_t type = propertyInt("vendor.ese_sim.type", 1);
  __android_log_print(ANDROID_LOG_INFO, kTag, "get_korva_exist_flag: %d", type);
  return type;
}

extern "C" int32_t phQvEse_init_open(void) {
  if (propertyFlag("vendor.ese_sim.fail_open")) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_init_open: failing (vendor.ese_sim.fail_open)");
    return -1;
  }
  Ese& e = ese();
  std::lock_guard<std::mutex> guard(e.lock);
  if (!e.opened) {
    int channels = propertyInt("vendor.ese_sim.channels", kDefaultChannels);
    if (channels < 1 || channels > se_card::kMaxChannels) channels = kDefaultChannels;
    if (channels != e.channels) {
      e.card = se_card::VirtualCard(se_card::CardOptions{channels, {}});
      e.channels = channels;
    }
    e.opened = true;
  }
  reportOpenChannels(e);
  __android_log_print(ANDROID_LOG_INFO, kTag, "phQvEse_init_open: open, %d channels, type %d", e.channels,
                      g_korva_exist);
  return 0;
}

extern "C" int32_t phQvEse_close(void) {
  Ese& e = ese();
  std::lock_guard<std::mutex> guard(e.lock);
  e.opened = false;
  e.card.reset();
  reportOpenChannels(e);
  __android_log_print(ANDROID_LOG_INFO, kTag, "phQvEse_close: closed, card reset");
  return 0;
}

extern "C" int32_t phQvEse_7816_Transceive(phQvEse_7816_cpdu* cpdu, phQvEse_7816_rpdu* rpdu) {
  if (cpdu == nullptr || rpdu == nullptr) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_7816_Transceive: null record");
    return -1;
  }
  Ese& e = ese();
  std::lock_guard<std::mutex> guard(e.lock);
  hangWhileAsked("phQvEse_7816_Transceive");
  rpdu->len = 0;
  const ExchangeFault fault = exchangeFault();
  rpdu->sw1 = static_cast<uint8_t>(fault.sw >> 8);
  rpdu->sw2 = static_cast<uint8_t>(fault.sw & 0xFF);
  if (fault.fail) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_7816_Transceive: failing (vendor.ese_sim.fail_exchange)");
    return -1;
  }
  if (!e.opened) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_7816_Transceive: eSE not open");
    return -1;
  }
  if (cpdu->lc > 255 || (cpdu->lc > 0 && cpdu->pdata == nullptr) ||
      (cpdu->le_type == 1 && (cpdu->le == 0 || cpdu->le > 256))) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_7816_Transceive: bad command record (lc %u, le_type %u, le %u)",
                        cpdu->lc, cpdu->le_type, cpdu->le);
    return -1;
  }
  std::vector<uint8_t> apdu = {cpdu->cla, cpdu->ins, cpdu->p1, cpdu->p2};
  if (cpdu->lc > 0) {
    apdu.push_back(static_cast<uint8_t>(cpdu->lc));
    apdu.insert(apdu.end(), cpdu->pdata, cpdu->pdata + cpdu->lc);
  }
  if (cpdu->le_type == 1) apdu.push_back(cpdu->le == 256 ? 0 : static_cast<uint8_t>(cpdu->le));
  const std::vector<uint8_t> r = exchange(e, apdu, "Transceive");
  const size_t dataLen = r.size() - 2;
  if (dataLen > kMaxRpduData || (dataLen > 0 && rpdu->pdata == nullptr)) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQvEse_7816_Transceive: %zu response bytes do not fit", dataLen);
    return -1;
  }
  if (dataLen > 0) memcpy(rpdu->pdata, r.data(), dataLen);
  rpdu->len = static_cast<uint16_t>(dataLen);
  rpdu->sw1 = r[dataLen];
  rpdu->sw2 = r[dataLen + 1];
  return 0;
}

extern "C" int32_t phQVNciHal_Transmit_APDU_by_IPC(phQvEse_data* cmd, phQvEse_data* rsp) {
  if (cmd == nullptr || rsp == nullptr) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Transmit_APDU_by_IPC: null record");
    return -1;
  }
  Ese& e = ese();
  std::lock_guard<std::mutex> guard(e.lock);
  hangWhileAsked("phQVNciHal_Transmit_APDU_by_IPC");
  rsp->len = 0;
  const ExchangeFault fault = exchangeFault();
  if (fault.fail) {
    if (fault.hasSw && rsp->p_data != nullptr) {
      rsp->p_data[0] = static_cast<uint8_t>(fault.sw >> 8);
      rsp->p_data[1] = static_cast<uint8_t>(fault.sw & 0xFF);
      rsp->len = 2;
    }
    __android_log_print(ANDROID_LOG_ERROR, kTag,
                        "phQVNciHal_Transmit_APDU_by_IPC: failing (vendor.ese_sim.fail_exchange)");
    return -1;
  }
  if (!e.opened) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Transmit_APDU_by_IPC: eSE not open");
    return -1;
  }
  if ((cmd->len > 0 && cmd->p_data == nullptr) || rsp->p_data == nullptr) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Transmit_APDU_by_IPC: null buffer");
    return -1;
  }
  std::vector<uint8_t> r;
  if (cmd->len > kMaxShortCommand) {
    // No short APDU is that long; the card would refuse it the same way.
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Transmit_APDU_by_IPC: %u-byte command too long",
                        cmd->len);
    r = {0x67, 0x00};
  } else {
    r = exchange(e, std::vector<uint8_t>(cmd->p_data, cmd->p_data + cmd->len), "IPC");
  }
  if (r.size() > kMaxIpcResponse) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Transmit_APDU_by_IPC: %zu response bytes do not fit",
                        r.size());
    return -1;
  }
  memcpy(rsp->p_data, r.data(), r.size());
  rsp->len = static_cast<uint32_t>(r.size());
  return 0;
}

extern "C" int32_t phQVNciHal_Set_KORVA_READY(void) {
  if (propertyFlag("vendor.ese_sim.fail_ready")) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Set_KORVA_READY: failing (vendor.ese_sim.fail_ready)");
    return -1;
  }
  __android_log_print(ANDROID_LOG_DEBUG, kTag, "phQVNciHal_Set_KORVA_READY: ready");
  return 0;
}

extern "C" int32_t phQVNciHal_Set_KORVA_Power(const char* state) {
  if (state == nullptr) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "phQVNciHal_Set_KORVA_Power: no state");
    return -1;
  }
  __android_log_print(ANDROID_LOG_DEBUG, kTag, "phQVNciHal_Set_KORVA_Power: %s", state);
  return 0;
}

extern "C" int32_t phQVNciHal_Get_KORVA_Ready_Status(void) {
  int32_t status = propertyInt("vendor.ese_sim.ready_status", 0);
  __android_log_print(ANDROID_LOG_DEBUG, kTag, "phQVNciHal_Get_KORVA_Ready_Status: %d", status);
  return status;
}

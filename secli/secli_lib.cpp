#include "secli_lib.h"

#include <host/aidl_host.h>
#include <host/rpc_host.h>

#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <thread>

namespace secli {

// The AIDL results' fields and line (secli_aidl.cpp).
std::string aidlJsonFields(const Result& r);
std::string aidlHumanLine(const Result& r);

using ::android::sp;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::Void;
using ::android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using ::android::hardware::secure_element::V1_0::LogicalChannelResponse;

namespace {

constexpr uint32_t kMaxSleepMs = 3600 * 1000;
constexpr double kMaxSeconds = 24 * 3600;

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// Whole seconds or fractions, 0 up to a day; milliseconds in *ms.
bool parseSeconds(const std::string& text, bool allowZero, int* ms) {
  if (text.empty()) return false;
  char* end = nullptr;
  errno = 0;
  double s = strtod(text.c_str(), &end);
  if (errno != 0 || end == text.c_str() || *end != '\0' || !std::isfinite(s)) return false;
  if (s < 0 || s > kMaxSeconds || (!allowZero && s <= 0)) return false;
  *ms = static_cast<int>(std::lround(s * 1000));
  if (!allowZero && *ms == 0) *ms = 1;
  return true;
}

std::string jsonString(const std::string& s) {
  std::string out = "\"";
  for (unsigned char c : s) {
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      default:
        if (c < 0x20) {
          char buf[8];
          snprintf(buf, sizeof(buf), "\\u%04x", c);
          out += buf;
        } else {
          out += static_cast<char>(c);
        }
    }
  }
  return out + "\"";
}

std::string statusName(SecureElementStatus s) {
  return ::android::hardware::secure_element::V1_0::toString(s);
}

template <typename R>
std::string errorText(const R& ret) {
  const std::string& m = ret.getStatus().exceptionMessage();
  return m.empty() ? ret.description() : m;
}

std::string secondsText(double s) {
  char buf[32];
  snprintf(buf, sizeof(buf), "%g", s);
  return buf;
}

struct CommandInfo {
  const char* name;
  CommandKind kind;
  const char* usage;
  const char* help;
};

const CommandInfo kCommands[] = {
    {"init", CommandKind::Init, "init",
     "Calls init with a callback and waits up to the time-out for onStateChange."},
    {"present", CommandKind::Present, "present", "Asks whether a card is present."},
    {"atr", CommandKind::Atr, "atr", "Reads the ATR."},
    {"open", CommandKind::Open, "open AID [P2]",
     "Opens a logical channel to the applet AID (hex). P2 defaults to 0."},
    {"basic", CommandKind::Basic, "basic AID [P2]",
     "Opens the basic channel to the applet AID (hex; \"\" for the default applet).\n"
     "P2 defaults to 0."},
    {"transmit", CommandKind::Transmit, "transmit APDU",
     "Sends a command APDU (hex; the rest of the line, spaces allowed) and prints\n"
     "the response with its status word."},
    {"close", CommandKind::Close, "close CHANNEL", "Closes a channel."},
    {"sleep", CommandKind::Sleep, "sleep MS", "Waits MS milliseconds (for scripts)."},
    {"reset", CommandKind::Reset, "reset",
     "Resets the element (AIDL only): every channel closed, then onStateChange\n"
     "false and true again; prints the states received."},
};

std::vector<std::string> wordsOf(const std::string& text) {
  std::vector<std::string> words;
  std::string cur;
  for (char c : text + " ") {
    if (c == ' ' || c == '\n') {
      if (!cur.empty()) words.push_back(cur);
      cur.clear();
    } else {
      cur += c;
    }
  }
  return words;
}

const CommandInfo* findCommand(const std::string& name) {
  for (const auto& c : kCommands) {
    if (name == c.name) return &c;
  }
  return nullptr;
}

class StateCallback : public ISecureElementHalCallback {
 public:
  Return<void> onStateChange(bool connected) override {
    state = connected;
    return Void();
  }
  std::optional<bool> state;
};

}  // namespace

bool parseHex(const std::string& text, std::vector<uint8_t>* out, std::string* error) {
  std::vector<uint8_t> bytes;
  int high = -1;
  for (char c : text) {
    if (c == ' ' || c == '\t') continue;
    int d = hexDigit(c);
    if (d < 0) {
      if (error) *error = "'" + text + "' is not hex";
      return false;
    }
    if (high < 0) {
      high = d;
    } else {
      bytes.push_back(static_cast<uint8_t>(high << 4 | d));
      high = -1;
    }
  }
  if (high >= 0) {
    if (error) *error = "'" + text + "' has an odd number of hex digits";
    return false;
  }
  *out = std::move(bytes);
  return true;
}

bool parseByte(const std::string& text, uint8_t* out) {
  std::string digits = text;
  int base = 10;
  if (digits.size() > 2 && digits[0] == '0' && (digits[1] == 'x' || digits[1] == 'X')) {
    digits = digits.substr(2);
    base = 16;
  }
  if (digits.empty() || digits.size() > 3) return false;
  unsigned v = 0;
  for (char c : digits) {
    int d = hexDigit(c);
    if (d < 0 || d >= base) return false;
    v = v * base + static_cast<unsigned>(d);
  }
  if (v > 255) return false;
  *out = static_cast<uint8_t>(v);
  return true;
}

bool splitLine(const std::string& line, std::vector<std::string>* words, std::string* error) {
  words->clear();
  std::string cur;
  bool inWord = false, quoted = false;
  for (char c : line) {
    if (quoted) {
      if (c == '"') {
        quoted = false;
      } else {
        cur += c;
      }
      continue;
    }
    if (c == '#') break;
    if (c == '"') {
      quoted = true;
      inWord = true;
    } else if (c == ' ' || c == '\t' || c == '\r' || c == '\n') {
      if (inWord) words->push_back(cur);
      cur.clear();
      inWord = false;
    } else {
      cur += c;
      inWord = true;
    }
  }
  if (quoted) {
    if (error) *error = "unclosed quote";
    return false;
  }
  if (inWord) words->push_back(cur);
  return true;
}

bool parseCommand(const std::vector<std::string>& words, Command* out, std::string* error) {
  if (words.empty()) {
    *error = "no command given";
    return false;
  }
  const CommandInfo* info = findCommand(words[0]);
  if (info == nullptr) {
    *error = "unknown command '" + words[0] + "'";
    return false;
  }
  Command c;
  c.kind = info->kind;
  c.name = info->name;
  size_t nargs = words.size() - 1;
  auto usage = [&](const std::string& why) {
    *error = why + "; usage: " + info->usage;
    return false;
  };
  switch (c.kind) {
    case CommandKind::Init:
    case CommandKind::Present:
    case CommandKind::Atr:
    case CommandKind::Reset:
      if (nargs != 0) return usage(std::string(info->name) + " takes no argument");
      break;
    case CommandKind::Open:
    case CommandKind::Basic:
      if (nargs < 1 || nargs > 2) {
        return usage(std::string(info->name) + " needs AID [P2] (quote an AID written with spaces)");
      }
      if (!parseHex(words[1], &c.bytes, error)) return false;
      if (nargs == 2 && !parseByte(words[2], &c.p2)) {
        return usage("P2 '" + words[2] + "' is not 0..255 (decimal or 0x hex)");
      }
      break;
    case CommandKind::Transmit: {
      std::string hex;
      for (size_t i = 1; i < words.size(); ++i) hex += words[i];
      if (!parseHex(hex, &c.bytes, error)) return false;
      if (c.bytes.empty()) return usage("transmit needs an APDU");
      break;
    }
    case CommandKind::Close:
      if (nargs != 1) return usage("close needs a channel number");
      if (!parseByte(words[1], &c.channel)) {
        return usage("channel '" + words[1] + "' is not 0..255 (decimal or 0x hex)");
      }
      break;
    case CommandKind::Sleep: {
      if (nargs != 1) return usage("sleep needs milliseconds");
      const std::string& w = words[1];
      char* end = nullptr;
      errno = 0;
      unsigned long v = strtoul(w.c_str(), &end, 10);
      if (w.empty() || w[0] == '-' || *end != '\0' || errno != 0 || v > kMaxSleepMs) {
        return usage("'" + w + "' is not 0.." + std::to_string(kMaxSleepMs) + " milliseconds");
      }
      c.ms = static_cast<uint32_t>(v);
      break;
    }
  }
  *out = std::move(c);
  return true;
}

std::string hexCompact(const std::vector<uint8_t>& bytes) {
  static const char* digits = "0123456789ABCDEF";
  std::string s;
  s.reserve(bytes.size() * 2);
  for (uint8_t b : bytes) {
    s += digits[b >> 4];
    s += digits[b & 0xF];
  }
  return s;
}

std::string hexGrouped(const std::vector<uint8_t>& bytes) {
  std::string compact = hexCompact(bytes);
  std::string s;
  for (size_t i = 0; i < compact.size(); i += 2) {
    if (i) s += ' ';
    s.append(compact, i, 2);
  }
  return s;
}

std::string describeStatusWord(uint8_t sw1, uint8_t sw2) {
  char buf[64];
  switch (sw1) {
    case 0x61:
      snprintf(buf, sizeof(buf), "more data, %u bytes available", sw2 ? sw2 : 256u);
      return buf;
    case 0x6C:
      snprintf(buf, sizeof(buf), "wrong Le, exact length %u", sw2 ? sw2 : 256u);
      return buf;
    case 0x63:
      if ((sw2 & 0xF0) == 0xC0) {
        snprintf(buf, sizeof(buf), "verification failed, %u tries left", sw2 & 0x0F);
        return buf;
      }
      break;
    default:
      break;
  }
  switch (sw1 << 8 | sw2) {
    case 0x9000: return "OK";
    case 0x6200: return "warning, memory unchanged";
    case 0x6281: return "part of returned data may be corrupted";
    case 0x6282: return "end of file reached before Le bytes";
    case 0x6283: return "selected file deactivated";
    case 0x6310: return "more data available";
    case 0x6400: return "execution error";
    case 0x6581: return "memory failure";
    case 0x6700: return "wrong length";
    case 0x6881: return "logical channel not supported";
    case 0x6882: return "secure messaging not supported";
    case 0x6982: return "security status not satisfied";
    case 0x6983: return "authentication method blocked";
    case 0x6984: return "reference data not usable";
    case 0x6985: return "conditions of use not satisfied";
    case 0x6986: return "command not allowed, no current EF";
    case 0x6999: return "applet selection failed";
    case 0x6A80: return "incorrect data";
    case 0x6A81: return "function not supported";
    case 0x6A82: return "file or application not found";
    case 0x6A84: return "not enough memory";
    case 0x6A86: return "incorrect P1-P2";
    case 0x6A88: return "referenced data not found";
    case 0x6B00: return "wrong P1-P2";
    case 0x6D00: return "INS not supported";
    case 0x6E00: return "CLA not supported";
    case 0x6F00: return "no precise diagnosis";
    default: return "";
  }
}

std::string statusWordNote(const std::vector<uint8_t>& response) {
  if (response.size() < 2) return "";
  uint8_t sw1 = response[response.size() - 2];
  uint8_t sw2 = response[response.size() - 1];
  std::string code = hexCompact({sw1, sw2});
  std::string meaning = describeStatusWord(sw1, sw2);
  return "(" + code + (meaning.empty() ? "" : ": " + meaning) + ")";
}

std::string jsonText(const std::string& s) { return jsonString(s); }

std::string formatJson(const Result& r) {
  std::string s = "{\"cmd\":" + jsonString(r.cmd);
  if (!r.error.empty()) return s + ",\"error\":" + jsonString(r.error) + "}";
  if (r.aidl) return s + aidlJsonFields(r) + "}";
  switch (r.kind) {
    case CommandKind::Init:
      s += ",\"state\":";
      s += r.state ? (*r.state ? "true" : "false") : "null";
      break;
    case CommandKind::Present:
      s += std::string(",\"present\":") + (r.present ? "true" : "false");
      break;
    case CommandKind::Atr:
      s += ",\"atr\":\"" + hexCompact(r.data) + "\"";
      break;
    case CommandKind::Open:
      s += ",\"status\":\"" + statusName(r.status) + "\",\"channel\":" +
           std::to_string(r.channel) + ",\"select\":\"" + hexCompact(r.data) + "\"";
      break;
    case CommandKind::Basic:
      s += ",\"status\":\"" + statusName(r.status) + "\",\"select\":\"" + hexCompact(r.data) +
           "\"";
      break;
    case CommandKind::Transmit:
      s += ",\"response\":\"" + hexCompact(r.data) + "\"";
      if (r.exchanges > 1) s += ",\"exchanges\":" + std::to_string(r.exchanges);
      break;
    case CommandKind::Close:
      s += ",\"status\":\"" + statusName(r.status) + "\"";
      break;
    case CommandKind::Sleep:
      s += ",\"ms\":" + std::to_string(r.ms);
      break;
    case CommandKind::Reset:
      break;
  }
  return s + "}";
}

std::string formatHuman(const Result& r) {
  // Transport errors are reported on standard error by the caller.
  if (!r.error.empty()) return "";
  if (r.aidl) return aidlHumanLine(r);
  auto withNote = [](const std::string& text, const std::vector<uint8_t>& data) {
    std::string note = statusWordNote(data);
    return note.empty() ? text : text + " " + note;
  };
  switch (r.kind) {
    case CommandKind::Init:
      if (!r.state) return "state=none (no onStateChange within " + secondsText(r.waitedSeconds) + " s)";
      return std::string("state=") + (*r.state ? "true" : "false");
    case CommandKind::Present:
      return std::string("present=") + (r.present ? "true" : "false");
    case CommandKind::Atr:
      return r.data.empty() ? "atr=(empty)" : "atr=" + hexGrouped(r.data);
    case CommandKind::Open:
      return withNote(statusName(r.status) + " channel=" + std::to_string(r.channel) +
                          " select=" + hexCompact(r.data),
                      r.data);
    case CommandKind::Basic:
      return withNote(statusName(r.status) + " select=" + hexCompact(r.data), r.data);
    case CommandKind::Transmit:
      return r.data.empty() ? "(empty response)" : withNote(hexGrouped(r.data), r.data);
    case CommandKind::Close:
      return statusName(r.status);
    case CommandKind::Sleep:
    case CommandKind::Reset:
      return "";
  }
  return "";
}

Session::Session(sp<ISecureElement> se, int timeoutMs) : mSe(std::move(se)), mTimeoutMs(timeoutMs) {}

Result Session::run(const Command& c) {
  Result r;
  r.kind = c.kind;
  r.cmd = c.name;
  switch (c.kind) {
    case CommandKind::Init: {
      sp<StateCallback> cb = new StateCallback();
      auto ret = mSe->init(cb);
      if (!ret.isOk()) {
        r.error = errorText(ret);
        break;
      }
      // The state may come during init or after it; wait for it up to the time-out.
      auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(mTimeoutMs);
      while (!cb->state) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                        deadline - std::chrono::steady_clock::now())
                        .count();
        if (left <= 0) break;
        if (::android::host::pollIncomingCalls(mSe, static_cast<int>(left)) < 0) {
          r.error = "connection to the service lost";
          break;
        }
      }
      r.state = cb->state;
      r.waitedSeconds = mTimeoutMs / 1000.0;
      break;
    }
    case CommandKind::Present: {
      Return<bool> ret = mSe->isCardPresent();
      if (!ret.isOk()) {
        r.error = errorText(ret);
      } else {
        r.present = ret;
      }
      break;
    }
    case CommandKind::Atr: {
      auto ret = mSe->getAtr([&](const hidl_vec<uint8_t>& atr) { r.data = atr; });
      if (!ret.isOk()) r.error = errorText(ret);
      break;
    }
    case CommandKind::Open: {
      auto ret = mSe->openLogicalChannel(
          c.bytes, c.p2, [&](const LogicalChannelResponse& resp, SecureElementStatus st) {
            r.channel = resp.channelNumber;
            r.data = resp.selectResponse;
            r.status = st;
          });
      if (!ret.isOk()) r.error = errorText(ret);
      break;
    }
    case CommandKind::Basic: {
      auto ret = mSe->openBasicChannel(
          c.bytes, c.p2, [&](const hidl_vec<uint8_t>& select, SecureElementStatus st) {
            r.data = select;
            r.status = st;
          });
      if (!ret.isOk()) r.error = errorText(ret);
      break;
    }
    case CommandKind::Transmit: {
      if (!mChain) {
        r.data = exchange(c.bytes, &r.error);
        break;
      }
      // A transport error ends the chain: the answers that follow are empty.
      r.data = transmitChained(
          c.bytes, [&](const std::vector<uint8_t>& apdu) {
            return r.error.empty() ? exchange(apdu, &r.error) : std::vector<uint8_t>();
          },
          &r.exchanges);
      break;
    }
    case CommandKind::Close: {
      Return<SecureElementStatus> ret = mSe->closeChannel(c.channel);
      if (!ret.isOk()) {
        r.error = errorText(ret);
      } else {
        r.status = ret;
      }
      break;
    }
    case CommandKind::Sleep:
      std::this_thread::sleep_for(std::chrono::milliseconds(c.ms));
      r.ms = c.ms;
      break;
    case CommandKind::Reset:
      r.error = "reset is an AIDL call (--aidl)";
      break;
  }
  return r;
}

std::vector<uint8_t> Session::exchange(const std::vector<uint8_t>& apdu, std::string* error) {
  if (mTrace) fprintf(mTrace, "secli: trace > %s\n", hexGrouped(apdu).c_str());
  std::vector<uint8_t> out;
  auto ret = mSe->transmit(apdu, [&](const hidl_vec<uint8_t>& resp) { out = resp; });
  if (!ret.isOk()) {
    *error = errorText(ret);
    out.clear();
  }
  if (mTrace) {
    fprintf(mTrace, "secli: trace < %s\n",
            !ret.isOk() ? "(transport error)" : out.empty() ? "(empty)" : hexGrouped(out).c_str());
    fflush(mTrace);
  }
  return out;
}

uint8_t channelOfCla(uint8_t cla) {
  return (cla & 0x40) ? static_cast<uint8_t>(4 + (cla & 0x0F)) : static_cast<uint8_t>(cla & 0x03);
}

uint8_t getResponseCla(uint8_t cla) {
  const uint8_t ch = channelOfCla(cla);
  return ch < 4 ? ch : static_cast<uint8_t>(0x40 | (ch - 4));
}

std::vector<uint8_t> withLe(const std::vector<uint8_t>& apdu, uint8_t le) {
  std::vector<uint8_t> out = apdu;
  const size_t n = apdu.size();
  if (n == 4) {
    out.push_back(le);  // case 1: add Le
  } else if (n == 5) {
    out[4] = le;  // case 2: replace Le
  } else if (n > 5 && apdu[4] != 0 && n == 5u + apdu[4]) {
    out.push_back(le);  // case 3: add Le
  } else if (n > 5 && apdu[4] != 0 && n == 6u + apdu[4]) {
    out.back() = le;  // case 4: replace Le
  } else {
    out.clear();  // too short or extended lengths: leave it to the caller
  }
  return out;
}

std::vector<uint8_t> transmitChained(const std::vector<uint8_t>& apdu, const TransmitFn& send,
                                     int* exchanges) {
  // Enough for the longest answer a card can give through 256-byte parts,
  // and a stop for a card that never ends.
  constexpr int kMaxExchanges = 300;
  int sent = 0;
  auto step = [&](const std::vector<uint8_t>& cmd) {
    ++sent;
    return send(cmd);
  };
  std::vector<uint8_t> resp = step(apdu);
  if (resp.size() >= 2 && resp[resp.size() - 2] == 0x6C) {
    std::vector<uint8_t> again = withLe(apdu, resp.back());
    if (!again.empty()) resp = step(again);
  }
  std::vector<uint8_t> joined;
  while (resp.size() >= 2 && resp[resp.size() - 2] == 0x61 && sent < kMaxExchanges) {
    joined.insert(joined.end(), resp.begin(), resp.end() - 2);
    const uint8_t cla = apdu.empty() ? 0 : getResponseCla(apdu[0]);
    resp = step({cla, 0xC0, 0x00, 0x00, resp.back()});
  }
  if (exchanges) *exchanges = sent;
  // A first answer without a status word (eSE1's 1F for a failed exchange)
  // is shown as it came; one in the middle of a chain fails the whole.
  if (resp.size() < 2) return joined.empty() ? resp : std::vector<uint8_t>{};
  joined.insert(joined.end(), resp.begin(), resp.end());
  return joined;
}

std::string mainHelp() {
  std::string s =
      "secli: talk to the secure element service.\n"
      "\n"
      "Usage:\n"
      "  secli [--root DIR] [--json] list [--wait SECONDS]\n"
      "  secli [--root DIR] [OPTIONS] -i NAME COMMAND [ARG...]\n"
      "  secli [--root DIR] [OPTIONS] -i NAME -f FILE|-\n"
      "\n"
      "Options:\n"
      "  --root DIR         device root (default: $SE_DEVICE_ROOT, else /)\n"
      "  --json             one JSON object per command per line\n"
      "  --timeout SECONDS  limit for each call, and how long init waits for\n"
      "                     onStateChange (default 10)\n"
      "  -i NAME            the instance, e.g. SIM1 or eSE1 (see 'list')\n"
      "  --aidl             speak the AIDL interface to the instance (the same\n"
      "                     name): errors come back as statuses by name\n"
      "  -f FILE            run the commands of FILE (- for standard input), one a\n"
      "                     line, '#' starts a comment; all on one connection\n"
      "  --chain            transmit follows 61xx with GET RESPONSE on the same\n"
      "                     channel and resends on 6Cxx with the Le asked for,\n"
      "                     printing the joined answer\n"
      "  --trace            writes every APDU sent (>) and received (<) to\n"
      "                     standard error, marked 'secli: trace'\n"
      "  -h, --help         this text; 'secli COMMAND --help' for one command\n"
      "\n"
      "Commands:\n";
  // The first sentence of each command's help; its continuation lines
  // indented under the first.
  const std::string indent(21, ' ');
  for (const auto& c : kCommands) {
    char head[32];
    snprintf(head, sizeof(head), "  %-18s ", c.usage);
    const std::string help(c.help);
    std::string line = head;
    size_t width = line.size();
    for (const std::string& word : wordsOf(help.substr(0, help.find('.') + 1))) {
      if (width > indent.size() && width + 1 + word.size() > 79) {
        line += "\n" + indent;
        width = indent.size();
      } else if (width > indent.size()) {
        line += ' ';
        ++width;
      }
      line += word;
      width += word.size();
    }
    s += line + "\n";
  }
  s += "  list [--wait SECONDS]\n" + indent + "Lists the registered instances.\n"
       "\n"
       "Hex accepts upper or lower case and spaces; P2 and CHANNEL accept decimal or\n"
       "0x hex. Exit status: 0 when every call went through (whatever the status it\n"
       "returned), 1 when a call failed in transport or the instance is missing,\n"
       "2 for usage errors.\n"
       "\n"
       "Example:\n"
       "  secli -i SIM1 init\n"
       "  secli -i SIM1 open A0000001510000 0x00\n"
       "  secli -i SIM1 transmit 81 CA 9F 7F 00\n"
       "  secli -i eSE1 --chain --trace -f session.txt\n"
       "  secli --aidl -i eSE1 -f session.txt   # init, open, transmit, reset\n";
  return s;
}

std::string commandHelp(const std::string& command) {
  if (command == "list") {
    return "Usage: secli [--root DIR] [--json] list [--wait SECONDS]\n"
           "Lists the registered instances, one a line: HIDL ones by their name\n"
           "(eSE1), AIDL ones by their full name\n"
           "(android.hardware.secure_element.ISecureElement/eSE1). With --wait, waits\n"
           "up to SECONDS until at least one is registered (exit 1 if none came).\n";
  }
  const CommandInfo* info = findCommand(command);
  if (info == nullptr) return mainHelp();
  return std::string("Usage: secli [OPTIONS] -i NAME ") + info->usage + "\n" + info->help + "\n";
}

ArgsOutcome parseArgs(const std::vector<std::string>& args, Options* out, std::string* message) {
  Options o;
  bool haveScript = false;
  size_t i = 0;
  auto value = [&](const std::string& opt, std::string* v) {
    if (i + 1 >= args.size()) {
      *message = opt + " needs a value";
      return false;
    }
    *v = args[++i];
    return true;
  };
  for (; i < args.size(); ++i) {
    const std::string& a = args[i];
    std::string v;
    if (a == "-h" || a == "--help") {
      *message = mainHelp();
      return ArgsOutcome::Help;
    } else if (a == "--json") {
      o.json = true;
    } else if (a == "--chain") {
      o.chain = true;
    } else if (a == "--trace") {
      o.trace = true;
    } else if (a == "--aidl") {
      o.aidl = true;
    } else if (a == "--root" || a.rfind("--root=", 0) == 0) {
      if (a == "--root") {
        if (!value(a, &v)) return ArgsOutcome::Usage;
      } else {
        v = a.substr(7);
      }
      if (v.empty()) {
        *message = "--root needs a folder";
        return ArgsOutcome::Usage;
      }
      o.root = v;
    } else if (a == "--timeout") {
      if (!value(a, &v)) return ArgsOutcome::Usage;
      if (!parseSeconds(v, false, &o.timeoutMs)) {
        *message = "--timeout '" + v + "' is not a number of seconds above 0";
        return ArgsOutcome::Usage;
      }
    } else if (a == "-i" || a == "--instance") {
      if (!value(a, &o.instance)) return ArgsOutcome::Usage;
    } else if (a == "-f" || a == "--file") {
      if (!value(a, &o.script)) return ArgsOutcome::Usage;
      haveScript = true;
    } else if (a.size() > 1 && a[0] == '-') {
      *message = "unknown option '" + a + "'";
      return ArgsOutcome::Usage;
    } else {
      break;
    }
  }
  o.command.assign(args.begin() + static_cast<std::ptrdiff_t>(i), args.end());
  for (const std::string& w : o.command) {
    if (w == "--help" || w == "-h") {
      *message = commandHelp(o.command[0]);
      return ArgsOutcome::Help;
    }
  }
  if (!o.command.empty() && o.command[0] == "help") {
    *message = o.command.size() > 1 ? commandHelp(o.command[1]) : mainHelp();
    return ArgsOutcome::Help;
  }
  if (!o.command.empty() && o.command[0] == "list") {
    if (haveScript) {
      *message = "list does not take -f";
      return ArgsOutcome::Usage;
    }
    o.list = true;
    for (size_t k = 1; k < o.command.size(); ++k) {
      if (o.command[k] == "--wait" && k + 1 < o.command.size() &&
          parseSeconds(o.command[k + 1], true, &o.listWaitMs)) {
        ++k;
      } else {
        *message = "usage: list [--wait SECONDS]";
        return ArgsOutcome::Usage;
      }
    }
    *out = std::move(o);
    return ArgsOutcome::Run;
  }
  if (haveScript && !o.command.empty()) {
    *message = "give either a command or -f, not both";
    return ArgsOutcome::Usage;
  }
  if (!haveScript && o.command.empty()) {
    *message = "no command given";
    return ArgsOutcome::Usage;
  }
  if (haveScript && o.script.empty()) {
    *message = "-f needs a file name or -";
    return ArgsOutcome::Usage;
  }
  if (o.instance.empty()) {
    *message = "-i NAME is required (see 'secli list')";
    return ArgsOutcome::Usage;
  }
  if (!o.command.empty()) {
    Command c;
    if (!parseCommand(o.command, &c, message)) return ArgsOutcome::Usage;
    if (c.kind == CommandKind::Reset && !o.aidl) {
      *message = "reset is an AIDL call; add --aidl";
      return ArgsOutcome::Usage;
    }
  }
  *out = std::move(o);
  return ArgsOutcome::Run;
}

namespace {

int runList(const Options& o, FILE* out, FILE* err) {
  auto deadline =
      std::chrono::steady_clock::now() + std::chrono::milliseconds(o.listWaitMs < 0 ? 0 : o.listWaitMs);
  auto both = [] {
    std::vector<std::string> names = ::android::host::listServices();
    for (auto& n : ::android::host::listAidlServices()) names.push_back(n);
    return names;
  };
  std::vector<std::string> names = both();
  while (o.listWaitMs >= 0 && names.empty() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    names = both();
  }
  if (o.json) {
    std::string s = "{\"cmd\":\"list\",\"instances\":[";
    for (size_t k = 0; k < names.size(); ++k) s += (k ? "," : "") + jsonString(names[k]);
    fprintf(out, "%s]}\n", s.c_str());
  } else {
    for (const auto& n : names) fprintf(out, "%s\n", n.c_str());
  }
  fflush(out);
  if (o.listWaitMs >= 0 && names.empty()) {
    fprintf(err, "secli: no instance registered within %s s\n",
            secondsText(o.listWaitMs / 1000.0).c_str());
    return 1;
  }
  return 0;
}

}  // namespace

int runMain(const std::vector<std::string>& args, FILE* out, FILE* err, FILE* in) {
  Options o;
  std::string message;
  switch (parseArgs(args, &o, &message)) {
    case ArgsOutcome::Help:
      fputs(message.c_str(), out);
      return 0;
    case ArgsOutcome::Usage:
      fprintf(err, "secli: %s (see secli --help)\n", message.c_str());
      return 2;
    case ArgsOutcome::Run:
      break;
  }
  if (!o.root.empty()) setenv("SE_DEVICE_ROOT", o.root.c_str(), 1);
  if (o.list) return runList(o, out, err);

  // A script file is checked whole before anything runs.
  std::vector<Command> commands;
  bool streaming = o.script == "-";
  if (!o.command.empty()) {
    commands.emplace_back();
    parseCommand(o.command, &commands.back(), &message);
  } else if (!streaming) {
    std::ifstream file(o.script);
    if (!file) {
      fprintf(err, "secli: cannot read %s: %s\n", o.script.c_str(), strerror(errno));
      return 2;
    }
    std::string line;
    for (int n = 1; std::getline(file, line); ++n) {
      std::vector<std::string> words;
      Command c;
      if (!splitLine(line, &words, &message) ||
          (!words.empty() && !parseCommand(words, &c, &message))) {
        fprintf(err, "secli: %s:%d: %s\n", o.script.c_str(), n, message.c_str());
        return 2;
      }
      if (!words.empty()) commands.push_back(std::move(c));
    }
  }

  if (!o.aidl) {
    for (const Command& c : commands) {
      if (c.kind == CommandKind::Reset) {
        fprintf(err, "secli: reset is an AIDL call; add --aidl\n");
        return 2;
      }
    }
  }
  std::function<Result(const Command&)> runCommand;
  std::unique_ptr<Session> session;
  std::unique_ptr<AidlSession> aidlSession;
  if (o.aidl) {
    aidlSession = AidlSession::connect(o.instance, o.timeoutMs);
    if (aidlSession == nullptr) {
      fprintf(err, "secli: no AIDL instance %s (%s)\n", o.instance.c_str(),
              ::android::host::aidlSocketPath(aidlInstanceName(o.instance)).c_str());
      return 1;
    }
    aidlSession->setChain(o.chain);
    if (o.trace) aidlSession->setTrace(err);
    runCommand = [&](const Command& c) { return aidlSession->run(c); };
  } else {
    sp<ISecureElement> se = ISecureElement::getService(o.instance);
    if (se == nullptr) {
      fprintf(err, "secli: no instance %s (%s)\n", o.instance.c_str(),
              ::android::host::serviceSocketPath(o.instance).c_str());
      return 1;
    }
    ::android::host::setCallTimeout(se, o.timeoutMs);
    session = std::make_unique<Session>(se, o.timeoutMs);
    session->setChain(o.chain);
    if (o.trace) session->setTrace(err);
    runCommand = [&](const Command& c) { return session->run(c); };
  }
  auto runOne = [&](const Command& c) {
    Result r = runCommand(c);
    std::string text = o.json ? formatJson(r) : formatHuman(r);
    if (!text.empty()) fprintf(out, "%s\n", text.c_str());
    fflush(out);
    if (r.error.empty()) return true;
    fprintf(err, "secli: %s: %s\n", r.cmd.c_str(), r.error.c_str());
    return false;
  };
  if (!streaming) {
    for (const Command& c : commands) {
      if (!runOne(c)) return 1;
    }
    return 0;
  }
  char* raw = nullptr;
  size_t cap = 0;
  int status = 0;
  for (int n = 1; getline(&raw, &cap, in) >= 0; ++n) {
    std::vector<std::string> words;
    Command c;
    if (!splitLine(raw, &words, &message) ||
        (!words.empty() && !parseCommand(words, &c, &message))) {
      fprintf(err, "secli: line %d: %s\n", n, message.c_str());
      status = 2;
      break;
    }
    if (words.empty()) continue;
    if (c.kind == CommandKind::Reset && !o.aidl) {
      fprintf(err, "secli: line %d: reset is an AIDL call; add --aidl\n", n);
      status = 2;
      break;
    }
    if (!runOne(c)) {
      status = 1;
      break;
    }
  }
  free(raw);
  return status;
}

}  // namespace secli

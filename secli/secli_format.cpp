// secli's output: hex texts, the status word catalogue, and each result as
// a human line or a JSON object.
#include "secli_internal.h"

#include <cstdio>

namespace secli {

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

namespace {

std::string statusName(SecureElementStatus s) {
  return ::android::hardware::secure_element::V1_0::toString(s);
}

}  // namespace

std::string secondsText(double s) {
  char buf[32];
  snprintf(buf, sizeof(buf), "%g", s);
  return buf;
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

}  // namespace secli

#include "at_responder.h"

#include <cctype>
#include <cstdio>

namespace modem_sim {

namespace {

const std::vector<std::string> kError = {"ERROR"};

// The 3GPP TS 27.007 texts of the standard codes; the card errors above 700
// are vendor codes without one, which a modem in verbose mode reports with
// the text of 100, "unknown".
const char* verboseText(int code) {
  switch (code) {
    case kCmeNotAllowed: return "operation not allowed";
    case kCmeNotSupported: return "operation not supported";
    case kCmeSimNotInserted: return "SIM not inserted";
    default: return "unknown";
  }
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// A cursor over the parameters of one command; every reader skips blanks
// before its field.
class Params {
 public:
  explicit Params(const std::string& s) : s_(s) {}

  bool integer(long& out) {
    skipBlanks();
    size_t start = pos_;
    long v = 0;
    while (pos_ < s_.size() && isdigit(static_cast<unsigned char>(s_[pos_]))) {
      if (v > 1000000000L) return false;
      v = v * 10 + (s_[pos_] - '0');
      ++pos_;
    }
    if (pos_ == start) return false;
    out = v;
    return true;
  }
  // A double-quoted string; the text may not hold a quote.
  bool quoted(std::string& out) {
    skipBlanks();
    if (pos_ >= s_.size() || s_[pos_] != '"') return false;
    size_t end = s_.find('"', pos_ + 1);
    if (end == std::string::npos) return false;
    out = s_.substr(pos_ + 1, end - pos_ - 1);
    pos_ = end + 1;
    return true;
  }
  bool comma() {
    skipBlanks();
    if (pos_ >= s_.size() || s_[pos_] != ',') return false;
    ++pos_;
    return true;
  }
  bool atEnd() {
    skipBlanks();
    return pos_ == s_.size();
  }

 private:
  void skipBlanks() {
    while (pos_ < s_.size() && s_[pos_] == ' ') ++pos_;
  }
  const std::string& s_;
  size_t pos_ = 0;
};

}  // namespace

bool decodeHex(const std::string& text, std::vector<uint8_t>& out) {
  out.clear();
  if (text.size() % 2 != 0) return false;
  out.reserve(text.size() / 2);
  for (size_t i = 0; i < text.size(); i += 2) {
    int hi = hexValue(text[i]), lo = hexValue(text[i + 1]);
    if (hi < 0 || lo < 0) return false;
    out.push_back(static_cast<uint8_t>(hi << 4 | lo));
  }
  return true;
}

std::string encodeHex(const std::vector<uint8_t>& bytes) {
  static const char kDigits[] = "0123456789ABCDEF";
  std::string s;
  s.reserve(bytes.size() * 2);
  for (uint8_t b : bytes) {
    s.push_back(kDigits[b >> 4]);
    s.push_back(kDigits[b & 0x0F]);
  }
  return s;
}

AtResponder::AtResponder(const ResponderOptions& options)
    : options_(options), card_(se_card::CardOptions{options.channels, options.atr}) {}

std::vector<std::string> AtResponder::cme(int code) const {
  switch (options_.errors) {
    case ResponderOptions::Errors::kBare: return kError;
    case ResponderOptions::Errors::kVerbose: return {std::string("+CME ERROR: ") + verboseText(code)};
    case ResponderOptions::Errors::kNumeric: break;
  }
  return {"+CME ERROR: " + std::to_string(code)};
}

int AtResponder::channelOfSession(long session) const {
  if (session <= 0) return -1;
  for (int c = 1; c < se_card::kMaxChannels; ++c) {
    if (sessions_[c] == session && card_.isChannelOpen(c)) return c;
  }
  return -1;
}

std::vector<std::string> AtResponder::handle(const std::string& line) {
  // Command names are matched without regard to case; parameters keep theirs.
  std::string upper = line;
  for (char& c : upper) c = static_cast<char>(toupper(static_cast<unsigned char>(c)));

  if (upper == "AT") return {"OK"};
  if (upper == "AT+CPIN?") {
    if (options_.cardAbsent) return cme(kCmeSimNotInserted);
    return {"+CPIN: READY", "OK"};
  }
  if (!options_.vendorQueries && (upper == "AT^CARDTYPE?" || upper == "AT^CARDATR")) return kError;
  if (upper == "AT^CARDTYPE?") {
    return {options_.cardAbsent ? "^CARDTYPE: 0,0,0" : "^CARDTYPE: 1,1,0", "OK"};
  }
  if (upper == "AT^CARDATR") {
    if (options_.cardAbsent) return cme(kCmeSimNotInserted);
    return {"^CARDATR: \"" + encodeHex(card_.atr()) + "\"", "OK"};
  }

  const size_t eq = line.find('=');
  if (eq == std::string::npos) return kError;
  const std::string name = upper.substr(0, eq + 1);
  const std::string params = line.substr(eq + 1);
  Params args(params);

  if (name == "AT+CCHO=" || name == "AT+CCHP=") {
    std::string aidText;
    long p2 = 0;
    if (!args.quoted(aidText)) return kError;
    if (name == "AT+CCHP=" && (!args.comma() || !args.integer(p2) || p2 > 255)) return kError;
    if (!args.atEnd()) return kError;
    std::vector<uint8_t> aid;
    if (!decodeHex(aidText, aid) || aid.empty() || aid.size() > 255) return kError;
    if (options_.cardAbsent) return cme(kCmeSimNotInserted);
    return openChannel(aid, static_cast<uint8_t>(p2), name == "AT+CCHO=" ? "+CCHO: " : "+CCHP: ");
  }
  if (name == "AT+CGLA=" || name == "AT+CSIM=") {
    long session = 0, length = 0;
    std::string text;
    if (name == "AT+CGLA=" && (!args.integer(session) || !args.comma())) return kError;
    if (!args.integer(length) || !args.comma() || !args.quoted(text) || !args.atEnd()) return kError;
    std::vector<uint8_t> apdu;
    if (static_cast<size_t>(length) != text.size() || !decodeHex(text, apdu) || apdu.empty()) return kError;
    if (options_.cardAbsent) return cme(kCmeSimNotInserted);
    if (name == "AT+CSIM=") return exchange(apdu, "+CSIM: ");
    const int channel = channelOfSession(session);
    if (channel < 0) return kError;
    // The modem puts the session's channel into the class byte.
    apdu[0] = se_card::claForChannel(apdu[0], channel);
    return exchange(apdu, "+CGLA: ");
  }
  if (name == "AT+CCHC=") {
    long session = 0;
    if (!args.integer(session) || !args.atEnd()) return kError;
    if (options_.cardAbsent) return cme(kCmeSimNotInserted);
    const int channel = channelOfSession(session);
    if (channel < 0) return kError;
    if (!card_.closeChannel(channel)) return cme(kCmeCardError);
    sessions_[channel] = 0;
    return {"OK"};
  }
  return kError;
}

std::vector<std::string> AtResponder::openChannel(const std::vector<uint8_t>& aid, uint8_t p2, const char* prefix) {
  const se_card::VirtualCard::OpenResult r = card_.openChannelAndSelect(aid, p2);
  switch (r.status) {
    case se_card::VirtualCard::OpenStatus::kOk:
      break;
    case se_card::VirtualCard::OpenStatus::kNoApplet:
      return cme(kCmeNoSuchApplet);
    case se_card::VirtualCard::OpenStatus::kNoChannel:
      return cme(kCmeNoChannel);
    case se_card::VirtualCard::OpenStatus::kCardError:
      return cme(kCmeCardError);
  }
  sessions_[r.channel] = options_.sessionBase + r.channel;
  const std::string id = std::to_string(sessions_[r.channel]);
  return {options_.bareOpen ? id : prefix + id, "OK"};
}

std::vector<std::string> AtResponder::exchange(const std::vector<uint8_t>& apdu, const char* prefix) {
  const std::vector<uint8_t> r = card_.process(apdu);
  const std::string hex = encodeHex(r);
  const size_t length = options_.shortLength ? hex.size() - 2 : hex.size();
  return {prefix + std::to_string(length) + ",\"" + hex + "\"", "OK"};
}

}  // namespace modem_sim

#pragma once
// The AT side of the modem simulator: one command line in, the answer lines
// out, for a virtual UICC (the virtual card) behind the 3GPP TS 27.007
// commands the daemon uses. No I/O here.
#include <cstdint>
#include <string>
#include <vector>

#include "virtual_card.h"

namespace modem_sim {

struct ResponderOptions {
  bool cardAbsent = false;
  std::vector<uint8_t> atr;  // empty: the card's default ATR
  int channels = se_card::kMaxChannels;
  // Session id of channel c is sessionBase + c; with a base that is a
  // multiple of 32 the low five bits of the id give the channel.
  int sessionBase = 0x100;
  // AT+CCHO/AT+CCHP answered in the bare form of 3GPP TS 27.007: the session
  // id alone on its line, no "+CCHO: " prefix.
  bool bareOpen = false;
  // +CGLA:/+CSIM: answers whose length field counts two characters fewer
  // than the text holds (a malformed answer, as some modems send).
  bool shortLength = false;
  // How error results read: "+CME ERROR: 10" (AT+CMEE=1), "+CME ERROR: SIM
  // not inserted" (AT+CMEE=2) or a bare "ERROR" (AT+CMEE=0).
  enum class Errors { kNumeric, kVerbose, kBare } errors = Errors::kNumeric;
  // AT^CARDTYPE? and AT^CARDATR known; without them both are unknown
  // commands (ERROR), as on most modems. AT+CPIN? is always answered.
  bool vendorQueries = true;
};

// Error codes of "+CME ERROR:" answers.
constexpr int kCmeNotAllowed = 3;
constexpr int kCmeNotSupported = 4;
constexpr int kCmeSimNotInserted = 10;
constexpr int kCmeNoSuchApplet = 716;
constexpr int kCmeNoChannel = 717;
constexpr int kCmeCardError = 760;

class AtResponder {
 public:
  explicit AtResponder(const ResponderOptions& options);

  // The lines (without line ends) that answer one command line; the last is
  // the final result ("OK", "ERROR" or "+CME ERROR: n" / "+CME ERROR: text").
  std::vector<std::string> handle(const std::string& line);

  se_card::VirtualCard& card() { return card_; }

 private:
  std::vector<std::string> openChannel(const std::vector<uint8_t>& aid, uint8_t p2, const char* prefix);
  std::vector<std::string> exchange(const std::vector<uint8_t>& apdu, const char* prefix);
  int channelOfSession(long session) const;
  // The error result for `code` in the chosen form.
  std::vector<std::string> cme(int code) const;

  ResponderOptions options_;
  se_card::VirtualCard card_;
  long sessions_[se_card::kMaxChannels] = {};  // 0: no session on that channel
};

// Hex text (either case) to bytes; false for odd length or a non-hex character.
bool decodeHex(const std::string& text, std::vector<uint8_t>& out);
std::string encodeHex(const std::vector<uint8_t>& bytes);

}  // namespace modem_sim

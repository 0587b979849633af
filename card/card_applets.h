#pragma once
// The applets installed on the virtual card, and what each one answers.
//
// AIDs (SELECT by DF name, P1 = 04, exact match):
//   ISD   A0 00 00 00 01 00 00 00  security-domain-like default. Selected on
//                                  the basic channel after reset, on every
//                                  newly opened logical channel, and by a
//                                  SELECT with no AID (no data or Lc = 0).
//                                  INS CA (GET DATA) P1P2 0066 or 9F7F gives
//                                  fixed card data; other P1P2 give 6A88.
//   ECHO  A0 00 00 00 01 01        INS 01: the command data back + 90 00.
//                                  INS 02: the command data back with the
//                                  status word P1 P2 (any word, for tests).
//   BIG   A0 00 00 00 01 02        answers longer than one response: its
//                                  SELECT answers 61 xx (the FCI waits for
//                                  GET RESPONSE). INS 10: P1P2 bytes (0 means
//                                  300; at most 4096) of the pattern 00 01 02
//                                  ..., sent at once when they fit one
//                                  response (256), else 61 00 and GET RESPONSE
//                                  chunks. INS 11: the same bytes, always left
//                                  for GET RESPONSE (61 xx). INS 12: the same
//                                  bytes in one response however many, Le
//                                  not looked at, as a card answering with
//                                  an extended length: for tests of the
//                                  callers' buffers at their edge.
//   P2    A0 00 00 00 01 03        reports the P2 of the SELECT that selected
//                                  it on the channel: its FCI holds the P2
//                                  under tag 85, and INS 20 returns that one
//                                  byte + 90 00.
//
// FCI of every applet: 6F L 84 <AID length> <AID> [applet-specific TLVs].
// Any INS an applet has no handler for gives 6D 00.
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

namespace se_card {

namespace aid {
extern const std::vector<uint8_t> kIsd;
extern const std::vector<uint8_t> kEcho;
extern const std::vector<uint8_t> kBig;
extern const std::vector<uint8_t> kP2Reporter;
}  // namespace aid

// One parsed command APDU (short length fields only).
struct Command {
  uint8_t cla = 0;
  uint8_t ins = 0;
  uint8_t p1 = 0;
  uint8_t p2 = 0;
  std::vector<uint8_t> data;
  bool hasLe = false;
  uint32_t ne = 0;  // expected length: Le, with Le 00 meaning 256; 0 without Le
  uint8_t channel = 0;
};

// What an applet hands back; the card turns it into response bytes.
struct Answer {
  std::vector<uint8_t> data;
  uint16_t sw = 0x9000;
  // Leave the data for GET RESPONSE (answer 61 xx) even when it fits.
  bool viaGetResponse = false;
  // Send the data in one response whatever its length and the Le.
  bool whole = false;
};

// Per-channel facts an applet may read.
struct ChannelContext {
  uint8_t channel = 0;
  uint8_t selectP2 = 0;  // P2 of the SELECT that selected the applet here
};

class Applet {
 public:
  using Handler = Answer (*)(const Command&, const ChannelContext&);

  Applet(std::string name, std::vector<uint8_t> aid, std::map<uint8_t, Handler> handlers);
  virtual ~Applet() = default;

  const std::string& name() const { return name_; }
  const std::vector<uint8_t>& aid() const { return aid_; }

  // The answer to the SELECT that selected it (the FCI, 90 00 by default).
  virtual Answer onSelect(const Command& select, const ChannelContext& ctx) const;
  // Any other command on a channel where it is selected: by the INS table.
  Answer process(const Command& cmd, const ChannelContext& ctx) const;

 protected:
  std::vector<uint8_t> fci(const std::vector<uint8_t>& extraTlvs) const;

 private:
  std::string name_;
  std::vector<uint8_t> aid_;
  std::map<uint8_t, Handler> handlers_;
};

// The registry: the ISD first, then ECHO, BIG and P2.
std::vector<std::unique_ptr<Applet>> makeDefaultApplets();

}  // namespace se_card

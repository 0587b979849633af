#pragma once
// A virtual ISO/IEC 7816-4 card: one function from command bytes to response
// bytes, with logical channels, SELECT by DF name over an applet registry and
// GET RESPONSE for data left waiting behind 61 xx. The same model stands
// behind the simulated eSE library and the modem simulator.
//
// Class byte: 0x00-0x03 name channels 0-3 (first interindustry values),
// 0x40-0x4F name channels 4-19 (further interindustry values); bit 0x80
// (proprietary class) keeps the same channel coding. 0xFF and the reserved
// values 0x20-0x3F (and 0xA0-0xBF) give 6E 00. Secure messaging and command
// chaining bits are not interpreted.
//
// Length fields: short APDUs only (cases 1 to 4); an extended or inconsistent
// length gives 67 00.
//
// Not thread-safe: the owner serialises calls.
#include <cstdint>
#include <memory>
#include <vector>

#include "card_applets.h"
#include "status_words.h"

namespace se_card {

constexpr int kMaxChannels = 20;  // channel numbers 0 to 19

struct CardOptions {
  // Channels the card supports, the basic channel included (1 to 20).
  int channels = kMaxChannels;
  // Empty: the default ATR.
  std::vector<uint8_t> atr;
};

// The channel a class byte names, or -1 for an invalid or reserved class.
int channelFromCla(uint8_t cla);
// `cla` with its channel bits set to name `channel` (0 to 19), keeping the
// proprietary bit; returned unchanged when `cla` is invalid or reserved.
uint8_t claForChannel(uint8_t cla, int channel);
// 3B 86 80 01 'S' 'E' '-' 'S' 'I' 'M' TCK: T=0 and T=1, checksum included.
std::vector<uint8_t> defaultAtr();

class VirtualCard {
 public:
  explicit VirtualCard(CardOptions options = CardOptions());

  // One command APDU in, one response APDU (data, then SW1 SW2) out. The
  // response holds at most 256 data bytes, but for BIG's INS 12.
  std::vector<uint8_t> process(const std::vector<uint8_t>& apdu);

  // Power cycle: every logical channel closed, the ISD selected on the basic
  // channel, waiting data dropped.
  void reset();

  const std::vector<uint8_t>& atr() const { return atr_; }
  int channelCount() const { return channelCount_; }
  bool isChannelOpen(int channel) const;
  // Name of the applet selected on an open channel, "" when none.
  std::string selectedApplet(int channel) const;

  // MANAGE CHANNEL open and SELECT by DF name in one step, for a modem's
  // open commands. On success the channel stays open with the applet
  // selected; when the SELECT fails the new channel is closed again.
  enum class OpenStatus { kOk, kNoChannel, kNoApplet, kCardError };
  struct OpenResult {
    OpenStatus status = OpenStatus::kCardError;
    int channel = -1;
    uint16_t sw = 0;  // the status word that decided
  };
  OpenResult openChannelAndSelect(const std::vector<uint8_t>& aid, uint8_t p2);
  // MANAGE CHANNEL close of channel 1 to 19; false when it is not open.
  bool closeChannel(int channel);

 private:
  struct Channel {
    bool open = false;
    const Applet* applet = nullptr;
    uint8_t selectP2 = 0;
    std::vector<uint8_t> pending;  // data waiting for GET RESPONSE
  };

  std::vector<uint8_t> dispatch(const Command& cmd, Channel& ch);
  std::vector<uint8_t> manageChannel(const Command& cmd);
  std::vector<uint8_t> select(const Command& cmd, Channel& ch);
  std::vector<uint8_t> getResponse(const Command& cmd, Channel& ch);
  std::vector<uint8_t> deliver(const Command& cmd, Channel& ch, Answer answer);
  const Applet* findApplet(const std::vector<uint8_t>& aid) const;

  int channelCount_;
  std::vector<uint8_t> atr_;
  std::vector<std::unique_ptr<Applet>> applets_;
  Channel channels_[kMaxChannels];
};

}  // namespace se_card

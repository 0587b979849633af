#pragma once
// The card side of vsmartcard's vpcd reader driver, as a pure state machine:
// the driver's byte stream cut into messages, and the virtual card's answer
// to each message.
//
// Wire format, both ways: a 2-byte big-endian length, then that many bytes.
// A 1-byte body from the driver is a control code (0 power off, 1 power on,
// 2 reset, 4 ATR request); only the ATR request is answered (with the ATR).
// Any other body (an empty one too) is a command APDU, answered with the
// response APDU.
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "virtual_card.h"

namespace se_vpcd {

constexpr size_t kMaxBody = 0xFFFF;

enum Control : uint8_t {
  kPowerOff = 0,
  kPowerOn = 1,
  kReset = 2,
  kAtrRequest = 4,
};

// One message on the wire; false when the body is longer than the 16-bit
// length can say.
bool frame(const std::vector<uint8_t>& body, std::vector<uint8_t>* out);

// Collects bytes as they arrive, in any pieces, and hands out whole bodies.
class FrameReader {
 public:
  void feed(const uint8_t* data, size_t len);
  // The next complete body, in arrival order.
  bool next(std::vector<uint8_t>* body);
  // Bytes of an incomplete message still waiting.
  size_t pending() const { return buf_.size() - pos_; }

 private:
  std::vector<uint8_t> buf_;
  size_t pos_ = 0;
};

// The virtual card behind one vpcd slot.
class CardSession {
 public:
  explicit CardSession(se_card::CardOptions options);

  struct Result {
    std::optional<std::vector<uint8_t>> reply;  // nothing for power events
    std::string event;                          // lines for the trace; "" for none
  };
  // One body from the driver.
  Result handle(const std::vector<uint8_t>& body);
  // The card is pulled out: like a power-off, whatever was open is gone.
  void remove();

  bool powered() const { return powered_; }
  se_card::VirtualCard& card() { return card_; }

 private:
  se_card::VirtualCard card_;
  bool powered_ = false;
  bool atrTold_ = false;
};

// Upper-case hex with a space between bytes.
std::string hexSpaced(const std::vector<uint8_t>& bytes);

}  // namespace se_vpcd

// The APDU rules secli's transmit follows on either interface: channels of
// a CLA, Le set again on 6C xx, GET RESPONSE on 61 xx.
#include "secli_lib.h"

namespace secli {

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

}  // namespace secli

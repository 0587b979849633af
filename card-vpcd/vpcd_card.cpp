#include "vpcd_card.h"

#include <cstdio>

namespace se_vpcd {

bool frame(const std::vector<uint8_t>& body, std::vector<uint8_t>* out) {
  if (body.size() > kMaxBody) return false;
  out->clear();
  out->reserve(2 + body.size());
  out->push_back(static_cast<uint8_t>(body.size() >> 8));
  out->push_back(static_cast<uint8_t>(body.size() & 0xFF));
  out->insert(out->end(), body.begin(), body.end());
  return true;
}

void FrameReader::feed(const uint8_t* data, size_t len) {
  // Drop what was handed out before growing, so a long session stays small.
  if (pos_ > 0 && pos_ == buf_.size()) {
    buf_.clear();
    pos_ = 0;
  }
  buf_.insert(buf_.end(), data, data + len);
}

bool FrameReader::next(std::vector<uint8_t>* body) {
  if (pending() < 2) return false;
  const size_t len = (static_cast<size_t>(buf_[pos_]) << 8) | buf_[pos_ + 1];
  if (pending() < 2 + len) return false;
  const auto begin = buf_.begin() + static_cast<std::ptrdiff_t>(pos_ + 2);
  body->assign(begin, begin + static_cast<std::ptrdiff_t>(len));
  pos_ += 2 + len;
  if (pos_ == buf_.size()) {
    buf_.clear();
    pos_ = 0;
  }
  return true;
}

CardSession::CardSession(se_card::CardOptions options) : card_(std::move(options)) {}

CardSession::Result CardSession::handle(const std::vector<uint8_t>& body) {
  Result r;
  if (body.size() == 1) {
    switch (body[0]) {
      case kPowerOff:
        card_.reset();
        powered_ = false;
        atrTold_ = false;
        r.event = "# power off: logical channels closed";
        return r;
      case kPowerOn:
        card_.reset();
        powered_ = true;
        atrTold_ = false;
        r.event = "# power on: logical channels closed";
        return r;
      case kReset:
        card_.reset();
        powered_ = true;
        atrTold_ = false;
        r.event = "# reset: logical channels closed";
        return r;
      case kAtrRequest:
        // The driver polls for the card with ATR requests; only the first
        // since the last power event is worth a trace line.
        r.reply = card_.atr();
        if (!atrTold_) r.event = "# ATR " + hexSpaced(card_.atr());
        atrTold_ = true;
        return r;
      default: {
        char text[48];
        snprintf(text, sizeof(text), "# unknown control code %u ignored", body[0]);
        r.event = text;
        return r;
      }
    }
  }
  // Any other body is an APDU, an empty one included: the driver waits for
  // an answer to each. A driver sends APDUs only to a powered card; one that
  // comes anyway is answered all the same.
  r.reply = card_.process(body);
  r.event = "< " + hexSpaced(body) + "\n> " + hexSpaced(*r.reply);
  return r;
}

void CardSession::remove() {
  card_.reset();
  powered_ = false;
  atrTold_ = false;
}

std::string hexSpaced(const std::vector<uint8_t>& bytes) {
  static const char kDigits[] = "0123456789ABCDEF";
  std::string s;
  s.reserve(bytes.size() * 3);
  for (size_t i = 0; i < bytes.size(); ++i) {
    if (i > 0) s.push_back(' ');
    s.push_back(kDigits[bytes[i] >> 4]);
    s.push_back(kDigits[bytes[i] & 0x0F]);
  }
  return s;
}

}  // namespace se_vpcd

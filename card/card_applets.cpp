#include "card_applets.h"

#include <utility>

#include "status_words.h"

namespace se_card {

namespace aid {
const std::vector<uint8_t> kIsd = {0xA0, 0x00, 0x00, 0x00, 0x01, 0x00, 0x00, 0x00};
const std::vector<uint8_t> kEcho = {0xA0, 0x00, 0x00, 0x00, 0x01, 0x01};
const std::vector<uint8_t> kBig = {0xA0, 0x00, 0x00, 0x00, 0x01, 0x02};
const std::vector<uint8_t> kP2Reporter = {0xA0, 0x00, 0x00, 0x00, 0x01, 0x03};
}  // namespace aid

Applet::Applet(std::string name, std::vector<uint8_t> aid, std::map<uint8_t, Handler> handlers)
    : name_(std::move(name)), aid_(std::move(aid)), handlers_(std::move(handlers)) {}

std::vector<uint8_t> Applet::fci(const std::vector<uint8_t>& extraTlvs) const {
  const size_t bodyLen = 2 + aid_.size() + extraTlvs.size();
  std::vector<uint8_t> out;
  out.reserve(2 + bodyLen);
  out.push_back(0x6F);
  out.push_back(static_cast<uint8_t>(bodyLen));
  out.push_back(0x84);
  out.push_back(static_cast<uint8_t>(aid_.size()));
  for (uint8_t b : aid_) out.push_back(b);
  for (uint8_t b : extraTlvs) out.push_back(b);
  return out;
}

Answer Applet::onSelect(const Command&, const ChannelContext&) const { return Answer{fci({}), SW_OK, false}; }

Answer Applet::process(const Command& cmd, const ChannelContext& ctx) const {
  auto it = handlers_.find(cmd.ins);
  if (it == handlers_.end()) return Answer{{}, SW_INS_NOT_SUPPORTED, false};
  return it->second(cmd, ctx);
}

namespace {

// Fixed card data for GET DATA on the ISD.
const std::vector<uint8_t> kCardData = {0x66, 0x06, 0x73, 0x04, 0x06, 0x02, 0x01, 0x01};
const std::vector<uint8_t> kCplc = {0x9F, 0x7F, 0x08, 0x53, 0x45, 0x43, 0x41, 0x52, 0x44, 0x00, 0x01};

Answer isdGetData(const Command& cmd, const ChannelContext&) {
  const unsigned tag = (static_cast<unsigned>(cmd.p1) << 8) | cmd.p2;
  if (tag == 0x0066) return Answer{kCardData, SW_OK, false};
  if (tag == 0x9F7F) return Answer{kCplc, SW_OK, false};
  return Answer{{}, SW_REFERENCED_DATA_NOT_FOUND, false};
}

class IsdApplet : public Applet {
 public:
  IsdApplet() : Applet("isd", aid::kIsd, {{0xCA, isdGetData}}) {}
  Answer onSelect(const Command&, const ChannelContext&) const override {
    // A5: proprietary data with a maximum command length of 255.
    return Answer{fci({0xA5, 0x04, 0x9F, 0x65, 0x01, 0xFF}), SW_OK, false};
  }
};

Answer echoData(const Command& cmd, const ChannelContext&) { return Answer{cmd.data, SW_OK, false}; }

Answer echoWithStatus(const Command& cmd, const ChannelContext&) {
  return Answer{cmd.data, static_cast<uint16_t>((cmd.p1 << 8) | cmd.p2), false};
}

constexpr size_t kBigDefault = 300;
constexpr size_t kBigMax = 4096;

Answer bigPattern(const Command& cmd, bool viaGetResponse, bool whole = false) {
  size_t n = (static_cast<size_t>(cmd.p1) << 8) | cmd.p2;
  if (n == 0) n = kBigDefault;
  if (n > kBigMax) return Answer{{}, SW_INCORRECT_P1P2, false};
  Answer a;
  a.data.resize(n);
  for (size_t i = 0; i < n; ++i) a.data[i] = static_cast<uint8_t>(i & 0xFF);
  a.viaGetResponse = viaGetResponse;
  a.whole = whole;
  return a;
}

Answer bigNow(const Command& cmd, const ChannelContext&) { return bigPattern(cmd, false); }
Answer bigLater(const Command& cmd, const ChannelContext&) { return bigPattern(cmd, true); }
Answer bigWhole(const Command& cmd, const ChannelContext&) { return bigPattern(cmd, false, true); }

class BigApplet : public Applet {
 public:
  BigApplet() : Applet("big", aid::kBig, {{0x10, bigNow}, {0x11, bigLater}, {0x12, bigWhole}}) {}
  Answer onSelect(const Command&, const ChannelContext&) const override {
    // Some proprietary filler so the FCI is worth fetching.
    std::vector<uint8_t> extra = {0xA5, 0x10};
    for (uint8_t i = 0; i < 0x10; ++i) extra.push_back(static_cast<uint8_t>(0xB0 + i));
    return Answer{fci(extra), SW_OK, true};
  }
};

Answer reportP2(const Command&, const ChannelContext& ctx) { return Answer{{ctx.selectP2}, SW_OK, false}; }

class P2Applet : public Applet {
 public:
  P2Applet() : Applet("p2", aid::kP2Reporter, {{0x20, reportP2}}) {}
  Answer onSelect(const Command& select, const ChannelContext&) const override {
    return Answer{fci({0x85, 0x01, select.p2}), SW_OK, false};
  }
};

}  // namespace

std::vector<std::unique_ptr<Applet>> makeDefaultApplets() {
  std::vector<std::unique_ptr<Applet>> v;
  v.push_back(std::make_unique<IsdApplet>());
  v.push_back(std::make_unique<Applet>("echo", aid::kEcho,
                                       std::map<uint8_t, Applet::Handler>{{0x01, echoData}, {0x02, echoWithStatus}}));
  v.push_back(std::make_unique<BigApplet>());
  v.push_back(std::make_unique<P2Applet>());
  return v;
}

}  // namespace se_card

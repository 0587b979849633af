#include "virtual_card.h"

#include <algorithm>

namespace se_card {

namespace {

constexpr uint8_t kInsManageChannel = 0x70;
constexpr uint8_t kInsSelect = 0xA4;
constexpr uint8_t kInsGetResponse = 0xC0;
constexpr size_t kMaxResponseData = 256;

std::vector<uint8_t> withSw(std::vector<uint8_t> data, uint16_t sw) {
  data.push_back(static_cast<uint8_t>(sw >> 8));
  data.push_back(static_cast<uint8_t>(sw & 0xFF));
  return data;
}

std::vector<uint8_t> swOnly(uint16_t sw) { return withSw({}, sw); }

// 61 xx / 6C xx with the count in the low byte, 256 or more written as 00.
uint16_t withCount(uint16_t base, size_t count) {
  return static_cast<uint16_t>(base | (count >= 256 ? 0 : count));
}

// Short APDUs only: cases 1 (header), 2 (header Le), 3 (header Lc data) and
// 4 (header Lc data Le). Lc 00 would start an extended length: refused.
bool parse(const std::vector<uint8_t>& a, Command& c) {
  if (a.size() < 4) return false;
  c.cla = a[0];
  c.ins = a[1];
  c.p1 = a[2];
  c.p2 = a[3];
  if (a.size() == 4) return true;
  if (a.size() == 5) {
    c.hasLe = true;
    c.ne = a[4] == 0 ? 256 : a[4];
    return true;
  }
  const size_t lc = a[4];
  if (lc == 0) return false;
  if (a.size() != 5 + lc && a.size() != 6 + lc) return false;
  c.data.assign(a.begin() + 5, a.begin() + 5 + static_cast<std::ptrdiff_t>(lc));
  if (a.size() == 6 + lc) {
    c.hasLe = true;
    c.ne = a.back() == 0 ? 256 : a.back();
  }
  return true;
}

// An Le byte other than 00 asks for exactly that many bytes.
bool exactLe(const Command& c) { return c.hasLe && c.ne < 256; }

}  // namespace

int channelFromCla(uint8_t cla) {
  if (cla == 0xFF) return -1;
  if (cla & 0x40) return (cla & 0x0F) + 4;
  if (cla & 0x20) return -1;
  return cla & 0x03;
}

uint8_t claForChannel(uint8_t cla, int channel) {
  if (channelFromCla(cla) < 0 || channel < 0 || channel >= kMaxChannels) return cla;
  const bool further = (cla & 0x40) != 0;
  const bool sm = further ? (cla & 0x20) != 0 : (cla & 0x0C) != 0;
  const uint8_t keep = static_cast<uint8_t>(cla & 0x90);  // proprietary and chaining bits
  if (channel < 4) return static_cast<uint8_t>(keep | (sm ? 0x08 : 0) | channel);
  return static_cast<uint8_t>(keep | 0x40 | (sm ? 0x20 : 0) | (channel - 4));
}

std::vector<uint8_t> defaultAtr() {
  std::vector<uint8_t> atr = {0x3B, 0x86, 0x80, 0x01, 'S', 'E', '-', 'S', 'I', 'M'};
  uint8_t tck = 0;
  for (size_t i = 1; i < atr.size(); ++i) tck ^= atr[i];
  atr.push_back(tck);
  return atr;
}

VirtualCard::VirtualCard(CardOptions options)
    : channelCount_(std::clamp(options.channels, 1, kMaxChannels)),
      atr_(options.atr.empty() ? defaultAtr() : std::move(options.atr)),
      applets_(makeDefaultApplets()) {
  reset();
}

void VirtualCard::reset() {
  for (Channel& ch : channels_) ch = Channel();
  channels_[0].open = true;
  channels_[0].applet = applets_.front().get();
}

bool VirtualCard::isChannelOpen(int channel) const {
  return channel >= 0 && channel < channelCount_ && channels_[channel].open;
}

std::string VirtualCard::selectedApplet(int channel) const {
  if (!isChannelOpen(channel) || channels_[channel].applet == nullptr) return "";
  return channels_[channel].applet->name();
}

std::vector<uint8_t> VirtualCard::process(const std::vector<uint8_t>& apdu) {
  if (apdu.size() < 4) return swOnly(SW_WRONG_LENGTH);
  const int channel = channelFromCla(apdu[0]);
  if (channel < 0) return swOnly(SW_CLA_NOT_SUPPORTED);
  Command cmd;
  if (!parse(apdu, cmd)) return swOnly(SW_WRONG_LENGTH);
  if (!isChannelOpen(channel)) return swOnly(SW_CHANNEL_NOT_SUPPORTED);
  cmd.channel = static_cast<uint8_t>(channel);
  return dispatch(cmd, channels_[channel]);
}

std::vector<uint8_t> VirtualCard::dispatch(const Command& cmd, Channel& ch) {
  if (cmd.ins == kInsGetResponse) return getResponse(cmd, ch);
  // Any other command gives up what was waiting on this channel.
  ch.pending.clear();
  if (cmd.ins == kInsManageChannel) return manageChannel(cmd);
  if (cmd.ins == kInsSelect) return select(cmd, ch);
  if (ch.applet == nullptr) return swOnly(SW_INS_NOT_SUPPORTED);
  ChannelContext ctx{cmd.channel, ch.selectP2};
  return deliver(cmd, ch, ch.applet->process(cmd, ctx));
}

std::vector<uint8_t> VirtualCard::manageChannel(const Command& cmd) {
  if (!cmd.data.empty()) return swOnly(SW_WRONG_LENGTH);
  if (cmd.p1 == 0x00) {
    int target = cmd.p2;
    if (target == 0) {
      // The card assigns the channel and answers with its number.
      if (exactLe(cmd) && cmd.ne != 1) return swOnly(withCount(SW_WRONG_LE, 1));
      for (int c = 1; c < channelCount_; ++c) {
        if (!channels_[c].open) {
          target = c;
          break;
        }
      }
      if (target == 0) return swOnly(SW_FUNCTION_NOT_SUPPORTED);
    } else if (target >= kMaxChannels) {
      return swOnly(SW_INCORRECT_P1P2);
    } else if (target >= channelCount_) {
      return swOnly(SW_CHANNEL_NOT_SUPPORTED);
    } else if (channels_[target].open) {
      return swOnly(SW_CONDITIONS_NOT_SATISFIED);
    }
    Channel& opened = channels_[target];
    opened = Channel();
    opened.open = true;
    opened.applet = applets_.front().get();
    if (cmd.p2 != 0) return swOnly(SW_OK);
    return withSw({static_cast<uint8_t>(target)}, SW_OK);
  }
  if (cmd.p1 == 0x80) {
    const int target = cmd.p2 != 0 ? cmd.p2 : cmd.channel;
    if (target == 0 || target >= kMaxChannels) return swOnly(SW_INCORRECT_P1P2);
    if (!isChannelOpen(target)) return swOnly(SW_CHANNEL_NOT_SUPPORTED);
    channels_[target] = Channel();
    return swOnly(SW_OK);
  }
  return swOnly(SW_INCORRECT_P1P2);
}

const Applet* VirtualCard::findApplet(const std::vector<uint8_t>& aid) const {
  if (aid.empty()) return applets_.front().get();
  for (const auto& a : applets_) {
    if (a->aid() == aid) return a.get();
  }
  return nullptr;
}

std::vector<uint8_t> VirtualCard::select(const Command& cmd, Channel& ch) {
  switch (cmd.p1) {
    case 0x04:
      break;
    case 0x00: case 0x01: case 0x02: case 0x03: case 0x08: case 0x09:
      // Selection by file identifier or path: the card has no file system.
      return swOnly(SW_NOT_FOUND);
    default:
      return swOnly(SW_INCORRECT_P1P2);
  }
  const Applet* applet = findApplet(cmd.data);
  // A failed SELECT leaves the current selection as it was.
  if (applet == nullptr) return swOnly(SW_NOT_FOUND);
  ch.applet = applet;
  ch.selectP2 = cmd.p2;
  Answer answer = applet->onSelect(cmd, ChannelContext{cmd.channel, cmd.p2});
  if ((cmd.p2 & 0x0C) == 0x0C) {
    // "No response data" asked.
    answer.data.clear();
    answer.viaGetResponse = false;
  }
  return deliver(cmd, ch, std::move(answer));
}

std::vector<uint8_t> VirtualCard::getResponse(const Command& cmd, Channel& ch) {
  if (cmd.p1 != 0 || cmd.p2 != 0) return swOnly(SW_INCORRECT_P1P2);
  if (!cmd.data.empty()) return swOnly(SW_WRONG_LENGTH);
  if (ch.pending.empty()) return swOnly(SW_CONDITIONS_NOT_SATISFIED);
  const size_t avail = ch.pending.size();
  if (exactLe(cmd) && cmd.ne > avail) return swOnly(withCount(SW_WRONG_LE, avail));
  const size_t n = std::min<size_t>(cmd.hasLe ? cmd.ne : kMaxResponseData, avail);
  std::vector<uint8_t> out(ch.pending.begin(), ch.pending.begin() + static_cast<std::ptrdiff_t>(n));
  ch.pending.erase(ch.pending.begin(), ch.pending.begin() + static_cast<std::ptrdiff_t>(n));
  const uint16_t sw = ch.pending.empty() ? static_cast<uint16_t>(SW_OK) : withCount(SW_BYTES_AVAILABLE, ch.pending.size());
  return withSw(std::move(out), sw);
}

std::vector<uint8_t> VirtualCard::deliver(const Command& cmd, Channel& ch, Answer answer) {
  if (answer.data.empty()) return swOnly(answer.sw);
  if (answer.whole) return withSw(std::move(answer.data), answer.sw);
  if (answer.viaGetResponse || answer.data.size() > kMaxResponseData) {
    ch.pending = std::move(answer.data);
    return swOnly(withCount(SW_BYTES_AVAILABLE, ch.pending.size()));
  }
  if (exactLe(cmd) && cmd.ne != answer.data.size()) {
    return swOnly(withCount(SW_WRONG_LE, answer.data.size()));
  }
  return withSw(std::move(answer.data), answer.sw);
}

VirtualCard::OpenResult VirtualCard::openChannelAndSelect(const std::vector<uint8_t>& aid, uint8_t p2) {
  OpenResult result;
  const std::vector<uint8_t> opened = process({0x00, kInsManageChannel, 0x00, 0x00, 0x01});
  result.sw = static_cast<uint16_t>((opened[opened.size() - 2] << 8) | opened.back());
  if (result.sw == SW_FUNCTION_NOT_SUPPORTED) {
    result.status = OpenStatus::kNoChannel;
    return result;
  }
  if (result.sw != SW_OK || opened.size() != 3) {
    result.status = OpenStatus::kCardError;
    return result;
  }
  const int channel = opened[0];
  if (aid.size() > 255) {
    closeChannel(channel);
    result.status = OpenStatus::kCardError;
    return result;
  }
  std::vector<uint8_t> sel = {claForChannel(0x00, channel), kInsSelect, 0x04, p2};
  if (!aid.empty()) {
    sel.push_back(static_cast<uint8_t>(aid.size()));
    sel.insert(sel.end(), aid.begin(), aid.end());
  }
  const std::vector<uint8_t> selected = process(sel);
  result.sw = static_cast<uint16_t>((selected[selected.size() - 2] << 8) | selected.back());
  if (result.sw == SW_OK || (result.sw & 0xFF00) == SW_BYTES_AVAILABLE) {
    result.status = OpenStatus::kOk;
    result.channel = channel;
    return result;
  }
  closeChannel(channel);
  result.status = result.sw == SW_NOT_FOUND ? OpenStatus::kNoApplet : OpenStatus::kCardError;
  return result;
}

bool VirtualCard::closeChannel(int channel) {
  if (channel < 1 || !isChannelOpen(channel)) return false;
  const std::vector<uint8_t> r = process({0x00, kInsManageChannel, 0x80, static_cast<uint8_t>(channel)});
  return r.size() == 2 && r[0] == 0x90 && r[1] == 0x00;
}

}  // namespace se_card

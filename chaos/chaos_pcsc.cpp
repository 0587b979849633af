#include "chaos_pcsc.h"

#include <fcntl.h>
#include <unistd.h>
#include <winscard.h>

#include <cstring>
#include <filesystem>
#include <fstream>

#include "chaos_env.h"
#include "chaos_record.h"
#include "pcsc_host.h"
#include "virtual_card.h"

namespace chaos {

namespace {

const char* const kReader = "Virtual PCD 00 00";

// Until the reader reports a card (or none), at most `ms`.
bool waitCard(bool present, int ms) {
  SCARDCONTEXT ctx;
  if (SCardEstablishContext(SCARD_SCOPE_SYSTEM, nullptr, nullptr, &ctx) != SCARD_S_SUCCESS) return false;
  SCARD_READERSTATE s{};
  s.szReader = kReader;
  s.dwCurrentState = SCARD_STATE_UNAWARE;
  const int64_t deadline = monoNanos() + int64_t(ms) * 1000000;
  bool reached = false;
  while (!reached) {
    const int64_t left = (deadline - monoNanos()) / 1000000;
    if (SCardGetStatusChange(ctx, static_cast<DWORD>(left > 0 ? left : 0), &s, 1) != SCARD_S_SUCCESS) break;
    reached = ((s.dwEventState & SCARD_STATE_PRESENT) != 0) == present;
    s.dwCurrentState = s.dwEventState & ~SCARD_STATE_CHANGED;
  }
  SCardReleaseContext(ctx);
  return reached;
}

}  // namespace

struct PcscEnv::Impl {
  std::string binDir, root;
  int port = pcsc_host::kDefaultVpcdPort;
  Proc pcscd;  // ours, when none ran
  Proc card;

  std::string trace() const { return root + "/card-vpcd.trace"; }

  static size_t countConnected(const std::string& path) {
    std::ifstream in(path);
    std::string line;
    size_t n = 0;
    while (std::getline(in, line)) n += line.find("connected") != std::string::npos ? 1 : 0;
    return n;
  }

  bool startCard(std::string* error) {
    // A new card: the trace's reader starts it afresh here.
    std::ofstream(trace(), std::ios::app) << "# chaos: new card\n";
    // Its standard output goes to a file: it tells each connection there,
    // and a pipe nobody reads any more would end it.
    const std::string out = root + "/card-vpcd.out";
    const size_t before = countConnected(out);
    const int fd = ::open(out.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    const bool ok = fd >= 0 && card.start({binDir + "/card-vpcd", "--port", std::to_string(port)}, {}, fd, trace());
    if (fd >= 0) close(fd);
    const int64_t deadline = monoNanos() + 10000LL * 1000000;
    while (ok && countConnected(out) == before && monoNanos() < deadline) usleep(5000);
    if (!ok || countConnected(out) == before) {
      *error = "card-vpcd did not connect to vpcd on port " + std::to_string(port);
      return false;
    }
    if (!waitCard(true, 10000)) {
      *error = std::string("pcscd did not see the card in \"") + kReader + "\"";
      return false;
    }
    return true;
  }

  bool removeCard(std::string* error) {
    card.stop();
    if (!waitCard(false, 10000)) {
      *error = "pcscd still sees a card";
      return false;
    }
    return true;
  }

  // Another application on the same reader resets the card: every logical
  // channel goes, and the library must reconnect without a new init.
  bool resetByOther(std::string* error) {
    SCARDCONTEXT ctx;
    LONG rv = SCardEstablishContext(SCARD_SCOPE_SYSTEM, nullptr, nullptr, &ctx);
    if (rv != SCARD_S_SUCCESS) {
      *error = std::string("SCardEstablishContext: ") + pcsc_stringify_error(rv);
      return false;
    }
    SCARDHANDLE h;
    DWORD proto = 0;
    rv = SCardConnect(ctx, kReader, SCARD_SHARE_SHARED, SCARD_PROTOCOL_T0 | SCARD_PROTOCOL_T1, &h, &proto);
    if (rv == SCARD_S_SUCCESS) rv = SCardDisconnect(h, SCARD_RESET_CARD);
    SCardReleaseContext(ctx);
    if (rv != SCARD_S_SUCCESS) {
      *error = std::string("reset by another application: ") + pcsc_stringify_error(rv);
      return false;
    }
    return true;
  }
};

PcscEnv::PcscEnv(std::string binDir, std::string root) : impl_(std::make_unique<Impl>()) {
  impl_->binDir = std::move(binDir);
  impl_->root = std::move(root);
}

PcscEnv::~PcscEnv() {
  impl_->card.stop();
  impl_->pcscd.stop();
}

std::string PcscEnv::unavailable() { return pcsc_host::unavailable(); }

bool PcscEnv::start(std::string* error) {
  if (!pcsc_host::pcscdRunning()) {
    // Our own pcscd in the foreground, with vpcd on ports of its own.
    impl_->port = pcsc_host::freePortPair();
    if (impl_->port == 0) {
      *error = "no two free TCP ports in a row for vpcd";
      return false;
    }
    const std::string conf = impl_->root + "/pcsc/reader.conf.d";
    std::error_code ec;
    std::filesystem::create_directories(conf, ec);
    writeFile(conf + "/vpcd", pcsc_host::readerConf(impl_->port));
    if (!impl_->pcscd.start({pcsc_host::pcscdPath(), "--foreground", "-c", conf}, {}, -1, impl_->root + "/pcscd.log")) {
      *error = "cannot start pcscd";
      return false;
    }
    const int64_t deadline = monoNanos() + 10000LL * 1000000;
    while (!pcsc_host::pcscdRunning()) {
      if (monoNanos() > deadline || !impl_->pcscd.running()) {
        *error = "pcscd did not come up (" + impl_->root + "/pcscd.log)";
        return false;
      }
      usleep(5000);
    }
  }
  return impl_->startCard(error);
}

std::string PcscEnv::readerName() const { return kReader; }

bool PcscEnv::apply(FaultKind k, bool on, std::string* error) {
  if (k == FaultKind::CardOut) return on ? impl_->removeCard(error) : impl_->startCard(error);
  if (k == FaultKind::OtherReset && on) return impl_->resetByOther(error);
  return true;
}

int PcscEnv::openChannels() const {
  // The card's trace replayed on the same card model: what it holds now.
  std::ifstream in(impl_->trace());
  if (!in) return -1;
  se_card::VirtualCard card(se_card::CardOptions{4, {}});
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("# power", 0) == 0 || line.rfind("# reset", 0) == 0 || line.rfind("# chaos: new card", 0) == 0) {
      card.reset();
    } else if (line.rfind("< ", 0) == 0) {
      std::vector<uint8_t> apdu;
      std::string hex;
      for (char c : line.substr(2)) {
        if (c != ' ') hex.push_back(c);
      }
      if (fromHex(hex, &apdu)) card.process(apdu);
    }
  }
  int n = 0;
  for (int c = 1; c < se_card::kMaxChannels; ++c) n += card.isChannelOpen(c) ? 1 : 0;
  return n;
}

}  // namespace chaos

#include "pcsc_env.h"

#include <gtest/gtest.h>

#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>

#include "pcsc_host.h"

namespace se_test {

const char* const kCardVpcd = SE_CARD_VPCD_PATH;
const char* const kPcscLibDir = SE_PCSC_LIB_DIR;

namespace {

namespace fs = std::filesystem;

// pcscd says it is ready a moment before its socket takes connections, and
// tells nothing when it does: ask the socket until it answers.
bool waitSocket(int ms) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
  while (!pcsc_host::pcscdRunning()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    usleep(2000);
  }
  return true;
}

std::vector<std::string> listReaders(SCARDCONTEXT ctx) {
  std::vector<std::string> out;
  DWORD size = 0;
  if (SCardListReaders(ctx, nullptr, nullptr, &size) != SCARD_S_SUCCESS) return out;
  std::vector<char> names(size + 1, '\0');
  if (SCardListReaders(ctx, nullptr, names.data(), &size) != SCARD_S_SUCCESS) return out;
  for (const char* p = names.data(); *p != '\0'; p += strlen(p) + 1) out.emplace_back(p);
  return out;
}

}  // namespace

PcscEnv::~PcscEnv() {
  if (daemon_) {
    daemon_->stop(SIGTERM);
    expectNoSanitizerReport("pcscd", daemon_->out().text() + daemon_->err().text());
  }
}

std::string PcscEnv::unavailable() { return pcsc_host::unavailable(); }

void PcscEnv::startOwn() {
  port_ = pcsc_host::freePortPair();
  ASSERT_NE(port_, 0) << "no two free TCP ports in a row for vpcd";
  config_ = std::make_unique<TempRoot>();
  config_->write("reader.conf.d/vpcd", pcsc_host::readerConf(port_));
  restartDaemon();
}

void PcscEnv::start() {
  pcscdPath_ = pcsc_host::pcscdPath();
  if (!pcsc_host::pcscdRunning()) {
    startOwn();
    return;
  }
  // Someone else's pcscd: usable when it serves vpcd's reader.
  port_ = pcsc_host::kDefaultVpcdPort;
  SCARDCONTEXT ctx;
  ASSERT_EQ(SCardEstablishContext(SCARD_SCOPE_SYSTEM, nullptr, nullptr, &ctx), SCARD_S_SUCCESS);
  const std::vector<std::string> readers = listReaders(ctx);
  SCardReleaseContext(ctx);
  bool found = false;
  for (const std::string& r : readers) found |= r == reader_;
  ASSERT_TRUE(found) << "a pcscd not started by these tests is running without the reader \"" << reader_
                     << "\" (vsmartcard-vpcd's /etc/reader.conf.d/vpcd, port " << pcsc_host::kDefaultVpcdPort
                     << "); stop it, or install vsmartcard-vpcd and restart it";
  ASSERT_TRUE(waitCard(false, 0)) << "\"" << reader_ << "\" already holds a card: another virtual card is connected";
}

void PcscEnv::stopDaemon() {
  ASSERT_TRUE(ours());
  daemon_->stop(SIGTERM);
  expectNoSanitizerReport("pcscd", daemon_->out().text() + daemon_->err().text());
  daemon_.reset();
}

void PcscEnv::restartDaemon() {
  ASSERT_FALSE(daemon_);
  ASSERT_TRUE(config_);
  daemon_ = std::make_unique<Process>(
      std::vector<std::string>{pcscdPath_, "--foreground", "--info", "-c", config_->at("reader.conf.d")},
      config_->path());
  ASSERT_TRUE(daemon_->out().waitFor("daemon ready") && waitSocket(kGenerousMs))
      << "pcscd did not start:\n" << daemon_->out().text() << daemon_->err().text();
}

bool PcscEnv::waitCard(bool present, int ms) {
  SCARDCONTEXT ctx;
  const LONG established = SCardEstablishContext(SCARD_SCOPE_SYSTEM, nullptr, nullptr, &ctx);
  if (established != SCARD_S_SUCCESS) {
    ADD_FAILURE() << "SCardEstablishContext: " << pcsc_stringify_error(established);
    return false;
  }
  SCARD_READERSTATE s{};
  s.szReader = reader_.c_str();
  s.dwCurrentState = SCARD_STATE_UNAWARE;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
  bool reached = false;
  // Each round waits for the next change from what was seen; a time-out or
  // pcscd gone ends it.
  while (!reached) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (SCardGetStatusChange(ctx, static_cast<DWORD>(std::max<long>(0, left.count())), &s, 1) != SCARD_S_SUCCESS) break;
    reached = ((s.dwEventState & SCARD_STATE_PRESENT) != 0) == present;
    s.dwCurrentState = s.dwEventState & ~SCARD_STATE_CHANGED;
  }
  SCardReleaseContext(ctx);
  return reached;
}

std::unique_ptr<Process> PcscEnv::startCard(const std::vector<std::string>& extra) {
  std::vector<std::string> argv{kCardVpcd, "--port", std::to_string(port_)};
  argv.insert(argv.end(), extra.begin(), extra.end());
  auto card = std::make_unique<Process>(argv, "/");
  EXPECT_TRUE(card->out().waitFor("connected")) << card->out().text() << card->err().text();
  EXPECT_TRUE(waitCard(true)) << "pcscd did not see the card in \"" << reader_ << "\"";
  return card;
}

void PcscEnv::removeCard(std::unique_ptr<Process>& card) {
  card->stop(SIGTERM);
  expectNoSanitizerReport("card-vpcd", card->err().text());
  EXPECT_TRUE(waitCard(false)) << "pcscd still sees a card in \"" << reader_ << "\"";
}

}  // namespace se_test

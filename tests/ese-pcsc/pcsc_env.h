#pragma once
// pcscd and the virtual card for tests that reach a card through PC/SC.
//
// pcscd's socket folder is machine-wide, so these tests never run at once
// (one ctest resource lock). A test uses the pcscd that is running, or, when
// none is, starts its own in the foreground with a reader configuration of
// its own (vpcd on a port of its own) and stops it at the end. Waits are on
// what pcscd and card-vpcd report, never on a clock alone.
#include <winscard.h>

#include <memory>
#include <string>
#include <vector>

#include "se_harness.h"

namespace se_test {

extern const char* const kCardVpcd;
// The folder of the PC/SC vendor library, for LD_LIBRARY_PATH.
extern const char* const kPcscLibDir;

class PcscEnv {
 public:
  PcscEnv() = default;
  ~PcscEnv();
  PcscEnv(const PcscEnv&) = delete;
  PcscEnv& operator=(const PcscEnv&) = delete;

  // Why pcscd cannot run here at all ("" when it can).
  static std::string unavailable();

  // Our pcscd when none runs, else the one running, which must serve a vpcd
  // reader on the default port; fails the test with the reason otherwise.
  void start();
  bool ours() const { return daemon_ != nullptr; }
  // Only ours: pcscd stopped (a reader unplugged) and started again.
  void stopDaemon();
  void restartDaemon();

  int port() const { return port_; }
  // The vpcd slot card-vpcd serves: "Virtual PCD 00 00".
  const std::string& reader() const { return reader_; }

  // card-vpcd on our port, until pcscd sees the card; removeCard pulls it
  // out (SIGTERM) until pcscd sees it gone.
  std::unique_ptr<Process> startCard(const std::vector<std::string>& extra = {});
  void removeCard(std::unique_ptr<Process>& card);
  // Until the reader reports a card (or none); false after `ms`.
  bool waitCard(bool present, int ms = kGenerousMs);

 private:
  void startOwn();

  std::unique_ptr<TempRoot> config_;
  std::unique_ptr<Process> daemon_;
  std::string pcscdPath_;
  int port_ = 0;
  std::string reader_ = "Virtual PCD 00 00";
};

// ctest counts a test that prints this as skipped.
#define SE_SKIP_WITHOUT_PCSCD()                                   \
  do {                                                            \
    const std::string why = ::se_test::PcscEnv::unavailable();    \
    if (!why.empty()) GTEST_SKIP() << "PC/SC tests skipped: " << why; \
  } while (0)

}  // namespace se_test

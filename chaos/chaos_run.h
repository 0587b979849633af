#pragma once
// One chaos run from start to report: the device root, modem-sim behind the
// fault relay, the daemon, the clients, the fault schedule, the judge, the
// end checks (channels left open, the daemon's health) and the report.
#include <cstdint>
#include <string>

namespace chaos {

struct RunOptions {
  uint64_t seed = 0;
  int seconds = 60;
  bool pcsc = false;
  std::string self;    // this program, started again as each client
  std::string binDir;  // qvese@1.0-service, modem-sim, card-vpcd
  std::string libDir;  // libese_qv_hal.so (simulated)
  std::string pcscLibDir;
  int hangMs = 3000;
  bool keep = false;
  bool verbose = false;
  int shown = 20;  // violations printed in full
};

// The exit status: 0 when every invariant held, 1 when one did not, 2 when
// the run could not be set up.
int runChaos(const RunOptions& o);

// Set from a signal handler: the run stops early and cleans up.
void requestStop();

}  // namespace chaos

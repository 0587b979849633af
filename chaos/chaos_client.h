#pragma once
// One soak client: a process of its own (so it can be killed mid-call and
// really die) that connects to one instance over one interface and runs a
// random but valid sequence of calls, reporting each to the soak's main
// process on a pipe: "S slot gen seq kind t0" before the call, the record
// (chaos_record.h) after it, "X slot gen" before it leaves by itself.
#include <cstdint>
#include <string>
#include <vector>

#include "chaos_record.h"

namespace chaos {

struct ClientArgs {
  int slot = 0;
  int gen = 0;
  uint64_t seed = 0;
  Inst inst = Inst::Ese;
  Iface iface = Iface::Hidl;
  int fd = -1;  // where records go
  // A short fixed sequence (init, open, transmit, close, presence, ATR),
  // then a tidy exit: the warm-up.
  bool probe = false;
  // Presence and ATR only, then a tidy exit: at the end, a call on each
  // instance that opens and closes nothing.
  bool nudge = false;
};

// The arguments that select client mode in se-chaos's command line.
std::vector<std::string> clientArgv(const ClientArgs& a);
// Parses them (after "--client"); false on anything unexpected.
bool parseClientArgv(const std::vector<std::string>& args, ClientArgs* out);

// Runs the client to its end; the process exit status.
int runClient(const ClientArgs& a);

// The command a client sends on a channel where `aid` is selected: one of
// the four APDU cases, drawn from `r` (a random number).
std::vector<uint8_t> commandFor(const std::vector<uint8_t>& aid, int channel, uint64_t r);

}  // namespace chaos

#pragma once
// The whole schedule of a chaos run, made from its seed alone: which client
// slots there are, when a client is killed, and every fault with its start,
// length and parameters. The same seed and length give the same plan.
#include <cstdint>
#include <string>
#include <vector>

#include "chaos_record.h"

namespace chaos {

enum class FaultKind {
  ModemSilence,  // the relay holds the daemon's commands and the modem's answers
  ModemSlow,     // each answer waits `a` ms before its first line
  ModemPieces,   // answers written in pieces of `a` bytes, 1 ms apart
  ModemUnsol,    // `a` unsolicited lines before each answer's final line
  ModemPortLost, // the port goes away (between commands) and comes back
  ModemRestart,  // the modem restarts: port gone, every channel of the card closed
  ModemBare,     // +CCHO:/+CCHP: answers rewritten to the bare session id
  LibHang,       // vendor.ese_sim.hang_exchange=1
  LibFail,       // vendor.ese_sim.fail_exchange=1, or the status word `a` (hex digits)
  LibSlow,       // exchanges whose P1 is `a` take `b` ms
  CardOut,       // PC/SC: the card pulled out of the reader, then put back
  OtherReset,    // PC/SC: another application resets the card
};
constexpr int kFaultKinds = 12;

const char* faultName(FaultKind k);
// The instance a fault hits.
Inst faultInst(FaultKind k);

struct Fault {
  FaultKind kind = FaultKind::ModemSilence;
  int64_t startMs = 0;  // from the start of the chaos phase
  int64_t endMs = 0;
  int a = 0;
  int b = 0;
};
// "modem-slow 120 ms/answer", for logs.
std::string describeFault(const Fault& f);

struct Slot {
  Inst inst = Inst::Ese;
  Iface iface = Iface::Hidl;
};

struct Kill {
  int slot = 0;
  int64_t atMs = 0;
};

struct Plan {
  uint64_t seed = 0;
  int64_t durationMs = 0;
  bool pcsc = false;
  std::vector<Slot> slots;
  std::vector<Fault> faults;  // by start
  std::vector<Kill> kills;    // by time
  // The seed of the gen-th client of a slot.
  uint64_t clientSeed(int slot, int gen) const;
};

// Without PC/SC the eSE's faults are the simulated library's; with it, the
// card's (pulled out, reset by another application).
Plan makePlan(uint64_t seed, int64_t durationMs, bool pcsc);

// The P1 values the clients' echo commands use; slow exchanges pick one.
constexpr uint8_t kEchoP1Max = 3;

}  // namespace chaos

#pragma once
// eSE1 through PC/SC for a chaos run (--pcsc): pcscd with vsmartcard's vpcd
// reader (started here when none runs), card-vpcd as the card, and the
// card's faults: pulled out and put back (card-vpcd stopped and started),
// and another application resetting it (this process as a PC/SC client).
#include <memory>
#include <string>

#include "chaos_plan.h"

namespace chaos {

class PcscEnv {
 public:
  PcscEnv(std::string binDir, std::string root);
  ~PcscEnv();
  PcscEnv(const PcscEnv&) = delete;
  PcscEnv& operator=(const PcscEnv&) = delete;

  // Why PC/SC cannot run here ("" when it can): pcscd or vpcd missing.
  static std::string unavailable();
  bool start(std::string* error);
  // Part of the reader's name, for vendor.ese_pcsc.reader.
  std::string readerName() const;
  bool apply(FaultKind k, bool on, std::string* error);
  // Logical channels open on the card now, from its trace; -1 unknown.
  int openChannels() const;

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

}  // namespace chaos

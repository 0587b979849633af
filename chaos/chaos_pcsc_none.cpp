// Built without libpcsclite: --pcsc is reported as skipped.
#include "chaos_pcsc.h"

namespace chaos {

struct PcscEnv::Impl {};
PcscEnv::PcscEnv(std::string, std::string) {}
PcscEnv::~PcscEnv() = default;
std::string PcscEnv::unavailable() { return "built without libpcsclite"; }
bool PcscEnv::start(std::string* error) {
  *error = unavailable();
  return false;
}
std::string PcscEnv::readerName() const { return ""; }
bool PcscEnv::apply(FaultKind, bool, std::string* error) {
  *error = unavailable();
  return false;
}
int PcscEnv::openChannels() const { return -1; }

}  // namespace chaos

#pragma once
// One client call as the soak sees it, the line a client sends for it to the
// soak's main process, and the names used in logs and reports.
#include <cstdint>
#include <string>
#include <vector>

namespace chaos {

enum class Inst { Ese, Sim };
enum class Iface { Hidl, Aidl };
enum class Kind { Init, Present, Atr, Open, Basic, Transmit, Close, Reset };
constexpr int kKinds = 8;

const char* instName(Inst i);   // "eSE1", "SIM1"
const char* ifaceName(Iface i);  // "HIDL", "AIDL"
const char* kindName(Kind k);    // "init", "open", ...
bool parseInst(const std::string& s, Inst* out);
bool parseIface(const std::string& s, Iface* out);
bool parseKind(const std::string& s, Kind* out);

std::string toHex(const std::vector<uint8_t>& bytes);
bool fromHex(const std::string& text, std::vector<uint8_t>* out);

// Nanoseconds of CLOCK_MONOTONIC: the same clock in every process of a run.
int64_t monoNanos();
// One millisecond in monoNanos().
constexpr int64_t kMs = 1000000;

struct CallRecord {
  int slot = -1;
  int gen = 0;   // the how-many-th client of its slot
  int pid = 0;
  long seq = 0;  // call number within that client
  Kind kind = Kind::Present;
  Inst inst = Inst::Ese;
  Iface iface = Iface::Hidl;
  int64_t t0 = 0;  // call start and end, monoNanos()
  int64_t t1 = 0;

  // What was asked.
  std::vector<uint8_t> cmd;  // open/basic: the AID; transmit: the APDU
  uint8_t p2 = 0;            // open/basic
  int channel = -1;          // transmit/close: the channel the client meant
  // transmit/close: the open call that gave the client this channel (its
  // start), and what it selected there; no applet for the basic channel of
  // the SIM, whose default applet stays.
  int64_t openedAt = 0;
  bool appletKnown = false;
  std::vector<uint8_t> appletAid;
  uint8_t appletP2 = 0;

  // What came back.
  std::string error;   // transport failure; empty when the call went through
  std::string status;  // AIDL: SUCCESS or the error's name; HIDL open/basic/close: the status
  bool present = false;
  std::vector<uint8_t> data;  // atr, select response, transmit response
  int resultChannel = -1;     // open
  int state = -1;             // init: -1 no onStateChange, 0 false, 1 true
  std::string states;         // reset: "01" for false then true
};

// "E <fields>": one line without the newline. Values hold no blanks.
std::string encodeRecord(const CallRecord& r);
bool decodeRecord(const std::string& line, CallRecord* out);

}  // namespace chaos

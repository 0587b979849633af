#include "chaos_record.h"

#include <time.h>

#include <cstdlib>
#include <sstream>

namespace chaos {

namespace {

const char* const kInstNames[] = {"eSE1", "SIM1"};
const char* const kIfaceNames[] = {"HIDL", "AIDL"};
const char* const kKindNames[] = {"init", "present", "atr", "open", "basic", "transmit", "close", "reset"};

template <typename E, size_t N>
bool parseName(const char* const (&names)[N], const std::string& s, E* out) {
  for (size_t i = 0; i < N; ++i) {
    if (s == names[i]) {
      *out = static_cast<E>(i);
      return true;
    }
  }
  return false;
}

// Transport error texts are free text: blanks become '_' on the wire.
std::string noBlanks(std::string s) {
  for (char& c : s) {
    if (c == ' ' || c == '\n' || c == '\t') c = '_';
  }
  return s.empty() ? "_" : s;
}

bool toLong(const std::string& s, long long* out) {
  if (s.empty()) return false;
  char* end = nullptr;
  long long v = strtoll(s.c_str(), &end, 10);
  if (*end != '\0') return false;
  *out = v;
  return true;
}

}  // namespace

const char* instName(Inst i) { return kInstNames[static_cast<int>(i)]; }
const char* ifaceName(Iface i) { return kIfaceNames[static_cast<int>(i)]; }
const char* kindName(Kind k) { return kKindNames[static_cast<int>(k)]; }
bool parseInst(const std::string& s, Inst* out) { return parseName(kInstNames, s, out); }
bool parseIface(const std::string& s, Iface* out) { return parseName(kIfaceNames, s, out); }
bool parseKind(const std::string& s, Kind* out) { return parseName(kKindNames, s, out); }

std::string toHex(const std::vector<uint8_t>& bytes) {
  static const char kDigits[] = "0123456789ABCDEF";
  std::string s;
  s.reserve(bytes.size() * 2);
  for (uint8_t b : bytes) {
    s.push_back(kDigits[b >> 4]);
    s.push_back(kDigits[b & 0x0F]);
  }
  return s;
}

bool fromHex(const std::string& text, std::vector<uint8_t>* out) {
  out->clear();
  if (text == "-") return true;
  if (text.size() % 2 != 0) return false;
  auto digit = [](char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    return -1;
  };
  for (size_t i = 0; i < text.size(); i += 2) {
    int hi = digit(text[i]), lo = digit(text[i + 1]);
    if (hi < 0 || lo < 0) return false;
    out->push_back(static_cast<uint8_t>(hi << 4 | lo));
  }
  return true;
}

int64_t monoNanos() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<int64_t>(ts.tv_sec) * 1000000000LL + ts.tv_nsec;
}

std::string encodeRecord(const CallRecord& r) {
  auto hex = [](const std::vector<uint8_t>& v) { return v.empty() ? std::string("-") : toHex(v); };
  std::ostringstream o;
  o << "E slot=" << r.slot << " gen=" << r.gen << " pid=" << r.pid << " seq=" << r.seq
    << " kind=" << kindName(r.kind) << " inst=" << instName(r.inst) << " iface=" << ifaceName(r.iface)
    << " t0=" << r.t0 << " t1=" << r.t1 << " cmd=" << hex(r.cmd) << " p2=" << int(r.p2)
    << " ch=" << r.channel << " opened=" << r.openedAt << " app=" << (r.appletKnown ? hex(r.appletAid) : "?")
    << " appp2=" << int(r.appletP2) << " err=" << (r.error.empty() ? "-" : noBlanks(r.error))
    << " st=" << (r.status.empty() ? "-" : r.status) << " present=" << (r.present ? 1 : 0)
    << " data=" << hex(r.data) << " rch=" << r.resultChannel << " state=" << r.state
    << " states=" << (r.states.empty() ? "-" : r.states);
  return o.str();
}

bool decodeRecord(const std::string& line, CallRecord* out) {
  std::istringstream in(line);
  std::string word;
  if (!(in >> word) || word != "E") return false;
  CallRecord r;
  int fields = 0;
  while (in >> word) {
    const size_t eq = word.find('=');
    if (eq == std::string::npos) return false;
    const std::string key = word.substr(0, eq), v = word.substr(eq + 1);
    long long n = 0;
    bool ok = true;
    if (key == "slot") ok = toLong(v, &n) && (r.slot = static_cast<int>(n), true);
    else if (key == "gen") ok = toLong(v, &n) && (r.gen = static_cast<int>(n), true);
    else if (key == "pid") ok = toLong(v, &n) && (r.pid = static_cast<int>(n), true);
    else if (key == "seq") ok = toLong(v, &n) && (r.seq = static_cast<long>(n), true);
    else if (key == "kind") ok = parseKind(v, &r.kind);
    else if (key == "inst") ok = parseInst(v, &r.inst);
    else if (key == "iface") ok = parseIface(v, &r.iface);
    else if (key == "t0") ok = toLong(v, &n) && (r.t0 = n, true);
    else if (key == "t1") ok = toLong(v, &n) && (r.t1 = n, true);
    else if (key == "cmd") ok = fromHex(v, &r.cmd);
    else if (key == "p2") ok = toLong(v, &n) && (r.p2 = static_cast<uint8_t>(n), true);
    else if (key == "ch") ok = toLong(v, &n) && (r.channel = static_cast<int>(n), true);
    else if (key == "opened") ok = toLong(v, &n) && (r.openedAt = n, true);
    else if (key == "app") ok = v == "?" || (r.appletKnown = true, fromHex(v, &r.appletAid));
    else if (key == "appp2") ok = toLong(v, &n) && (r.appletP2 = static_cast<uint8_t>(n), true);
    else if (key == "err") r.error = v == "-" ? "" : v;
    else if (key == "st") r.status = v == "-" ? "" : v;
    else if (key == "present") r.present = v == "1";
    else if (key == "data") ok = fromHex(v, &r.data);
    else if (key == "rch") ok = toLong(v, &n) && (r.resultChannel = static_cast<int>(n), true);
    else if (key == "state") ok = toLong(v, &n) && (r.state = static_cast<int>(n), true);
    else if (key == "states") r.states = v == "-" ? "" : v;
    else ok = false;
    if (!ok) return false;
    ++fields;
  }
  if (fields != 22) return false;
  *out = std::move(r);
  return true;
}

}  // namespace chaos

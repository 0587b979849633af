#include "fake_ese_hal.h"

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstring>
#include <deque>
#include <mutex>

#include "ese_qv_hal.h"

extern "C" {
int32_t g_korva_exist = 0;
}

namespace fake_ese {
namespace {

// The caller's IPC response buffer holds this many bytes by contract.
constexpr size_t kIpcBufSize = 270;

struct State {
  std::mutex mu;
  std::condition_variable cv;
  std::deque<IpcReply> ipc;
  std::deque<TransceiveReply> trx;
  int32_t readyRc = 0;
  int32_t readyStatus = 0;
  int32_t initOpenRc = 0;
  int32_t eseType = 1;
  std::vector<std::string> calls;
  bool blockNext = false;
  bool blocked = false;
  bool released = false;
};

State& state() {
  static State s;
  return s;
}

void record(State& s, const std::string& line) {
  s.calls.push_back(line);
  s.cv.notify_all();
}

std::string hexBytes(const uint8_t* p, size_t n) {
  std::string out;
  char b[4];
  for (size_t i = 0; i < n; ++i) {
    std::snprintf(b, sizeof(b), "%02X", p[i]);
    if (!out.empty()) out += ' ';
    out += b;
  }
  return out;
}

}  // namespace

std::string hex(const std::vector<uint8_t>& bytes) { return hexBytes(bytes.data(), bytes.size()); }

void reset() {
  State& s = state();
  std::lock_guard<std::mutex> l(s.mu);
  s.ipc.clear();
  s.trx.clear();
  s.readyRc = 0;
  s.readyStatus = 0;
  s.initOpenRc = 0;
  s.eseType = 1;
  s.calls.clear();
  s.blockNext = s.blocked = s.released = false;
}

namespace {
template <typename T, typename V>
void setLocked(T State::*field, V value) {
  std::lock_guard<std::mutex> l(state().mu);
  state().*field = value;
}
}  // namespace

void queueIpc(const IpcReply& reply) {
  std::lock_guard<std::mutex> l(state().mu);
  state().ipc.push_back(reply);
}
void queueTransceive(const TransceiveReply& reply) {
  std::lock_guard<std::mutex> l(state().mu);
  state().trx.push_back(reply);
}
void setReadyResult(int32_t rc) { setLocked(&State::readyRc, rc); }
void setReadyStatus(int32_t st) { setLocked(&State::readyStatus, st); }
void setInitOpenResult(int32_t rc) { setLocked(&State::initOpenRc, rc); }
void setEseType(int32_t type) { setLocked(&State::eseType, type); }

std::vector<std::string> calls() {
  std::lock_guard<std::mutex> l(state().mu);
  return state().calls;
}
void clearCalls() {
  std::lock_guard<std::mutex> l(state().mu);
  state().calls.clear();
}

void blockNextIpc() {
  std::lock_guard<std::mutex> l(state().mu);
  state().blockNext = true;
  state().blocked = false;
  state().released = false;
}

bool waitIpcBlocked(int timeoutMs) {
  State& s = state();
  std::unique_lock<std::mutex> l(s.mu);
  return s.cv.wait_for(l, std::chrono::milliseconds(timeoutMs), [&] { return s.blocked; });
}

void releaseBlockedIpc() {
  State& s = state();
  std::lock_guard<std::mutex> l(s.mu);
  s.released = true;
  s.cv.notify_all();
}

bool waitForCall(const std::string& line, int timeoutMs) {
  State& s = state();
  std::unique_lock<std::mutex> l(s.mu);
  return s.cv.wait_for(l, std::chrono::milliseconds(timeoutMs), [&] {
    for (const auto& c : s.calls)
      if (c == line) return true;
    return false;
  });
}

}  // namespace fake_ese

using fake_ese::state;

namespace {
// Records one plain call and answers with `result`.
int32_t plainCall(const std::string& line, int32_t fake_ese::State::*result = nullptr) {
  auto& s = state();
  std::lock_guard<std::mutex> l(s.mu);
  fake_ese::record(s, line);
  return result ? s.*result : 0;
}
}  // namespace

extern "C" {

int32_t get_korva_exist_flag(void) { return plainCall("type", &fake_ese::State::eseType); }
int32_t phQvEse_init_open(void) { return plainCall("open", &fake_ese::State::initOpenRc); }
int32_t phQvEse_close(void) { return plainCall("close"); }
int32_t phQVNciHal_Set_KORVA_READY(void) { return plainCall("ready", &fake_ese::State::readyRc); }
int32_t phQVNciHal_Get_KORVA_Ready_Status(void) {
  return plainCall("status", &fake_ese::State::readyStatus);
}
int32_t phQVNciHal_Set_KORVA_Power(const char* what) {
  return plainCall(std::string("power ") + (what ? what : "(null)"));
}

int32_t phQVNciHal_Transmit_APDU_by_IPC(phQvEse_data* cmd, phQvEse_data* rsp) {
  auto& s = state();
  std::unique_lock<std::mutex> l(s.mu);
  fake_ese::record(s, "ipc " + fake_ese::hexBytes(cmd->p_data, cmd->len));
  if (s.blockNext) {
    s.blockNext = false;
    s.blocked = true;
    s.cv.notify_all();
    s.cv.wait(l, [&] { return s.released; });
  }
  if (s.ipc.empty()) return -1;
  fake_ese::IpcReply r = s.ipc.front();
  s.ipc.pop_front();
  const size_t n = std::min(r.bytes.size(), fake_ese::kIpcBufSize);
  if (n) std::memcpy(rsp->p_data, r.bytes.data(), n);
  rsp->len = r.reportedLen >= 0 ? static_cast<uint32_t>(r.reportedLen) : static_cast<uint32_t>(n);
  return r.rc;
}

int32_t phQvEse_7816_Transceive(phQvEse_7816_cpdu* c, phQvEse_7816_rpdu* r) {
  auto& s = state();
  std::lock_guard<std::mutex> l(s.mu);
  char head[64];
  std::snprintf(head, sizeof(head), "trx %02X %02X %02X %02X lc=%u", c->cla, c->ins, c->p1, c->p2,
                static_cast<unsigned>(c->lc));
  std::string line = head;
  if (c->lc) line += " " + fake_ese::hexBytes(c->pdata, c->lc);
  char tail[64];
  std::snprintf(tail, sizeof(tail), " le_type=%u le=%u rlen=%u", c->le_type, c->le,
                static_cast<unsigned>(r->len));
  line += tail;
  fake_ese::record(s, line);
  if (s.trx.empty()) return -1;
  fake_ese::TransceiveReply rep = s.trx.front();
  s.trx.pop_front();
  // Callers hand 256 or 270 bytes; scripts stay within the smaller.
  const size_t n = std::min<size_t>(rep.data.size(), 256);
  if (n) std::memcpy(r->pdata, rep.data.data(), n);
  r->len = rep.reportedLen >= 0 ? static_cast<uint16_t>(rep.reportedLen) : static_cast<uint16_t>(n);
  r->sw1 = rep.sw1;
  r->sw2 = rep.sw2;
  return rep.rc;
}

}  // extern "C"

#include "fake_ese_hal.h"

#include <algorithm>
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

struct State {
  std::mutex mu;
  std::deque<IpcReply> ipc;
  std::deque<TransceiveReply> trx;
  int32_t readyRc = 0, readyStatus = 0, initOpenRc = 0, eseType = 1;
  std::vector<std::string> calls;
  // One IPC exchange can be held inside the library until the test lets go,
  // standing in for a library call that does not return.
  std::condition_variable cv;
  bool blockNext = false, blocked = false, released = false;
} g_s;

using Lock = std::unique_lock<std::mutex>;

void record(const std::string& line) { g_s.calls.push_back(line); }

std::string hexBytes(const uint8_t* p, size_t n) {
  std::string out;
  char b[4];
  for (size_t i = 0; i < n; ++i) {
    std::snprintf(b, sizeof(b), i ? " %02X" : "%02X", p[i]);
    out += b;
  }
  return out;
}

int32_t plainCall(const std::string& line, int32_t State::*result = nullptr) {
  Lock l(g_s.mu);
  record(line);
  return result ? g_s.*result : 0;
}

void set(int32_t State::*field, int32_t v) {
  Lock l(g_s.mu);
  g_s.*field = v;
}

}  // namespace

std::string hex(const std::vector<uint8_t>& bytes) { return hexBytes(bytes.data(), bytes.size()); }

void reset() {
  Lock l(g_s.mu);
  g_s.ipc.clear();
  g_s.trx.clear();
  g_s.readyRc = g_s.readyStatus = g_s.initOpenRc = 0;
  g_s.eseType = 1;
  g_s.calls.clear();
  g_s.blockNext = g_s.blocked = g_s.released = false;
}

void blockNextIpc() {
  Lock l(g_s.mu);
  g_s.blockNext = true;
  g_s.blocked = g_s.released = false;
}
bool waitIpcBlocked(int timeoutMs) {
  Lock l(g_s.mu);
  return g_s.cv.wait_for(l, std::chrono::milliseconds(timeoutMs), [] { return g_s.blocked; });
}
void releaseBlockedIpc() {
  Lock l(g_s.mu);
  g_s.released = true;
  g_s.cv.notify_all();
}

void queueIpc(const IpcReply& reply) {
  Lock l(g_s.mu);
  g_s.ipc.push_back(reply);
}
void queueTransceive(const TransceiveReply& reply) {
  Lock l(g_s.mu);
  g_s.trx.push_back(reply);
}
void setReadyResult(int32_t rc) { set(&State::readyRc, rc); }
void setReadyStatus(int32_t st) { set(&State::readyStatus, st); }
void setInitOpenResult(int32_t rc) { set(&State::initOpenRc, rc); }
void setEseType(int32_t type) { set(&State::eseType, type); }

std::vector<std::string> calls() {
  Lock l(g_s.mu);
  return g_s.calls;
}
void clearCalls() {
  Lock l(g_s.mu);
  g_s.calls.clear();
}
void note(const std::string& line) { plainCall(line); }

}  // namespace fake_ese

using fake_ese::g_s;
using fake_ese::State;

extern "C" {

int32_t get_korva_exist_flag(void) { return fake_ese::plainCall("type", &State::eseType); }
int32_t phQvEse_init_open(void) { return fake_ese::plainCall("open", &State::initOpenRc); }
int32_t phQvEse_close(void) { return fake_ese::plainCall("close"); }
int32_t phQVNciHal_Set_KORVA_READY(void) { return fake_ese::plainCall("ready", &State::readyRc); }
int32_t phQVNciHal_Get_KORVA_Ready_Status(void) {
  return fake_ese::plainCall("status", &State::readyStatus);
}
int32_t phQVNciHal_Set_KORVA_Power(const char* what) {
  return fake_ese::plainCall(std::string("power ") + (what ? what : "(null)"));
}

int32_t phQVNciHal_Transmit_APDU_by_IPC(phQvEse_data* cmd, phQvEse_data* rsp) {
  fake_ese::Lock l(g_s.mu);
  fake_ese::record("ipc " + fake_ese::hexBytes(cmd->p_data, cmd->len));
  if (g_s.blockNext) {
    g_s.blockNext = false;
    g_s.blocked = true;
    g_s.cv.notify_all();
    g_s.cv.wait(l, [] { return g_s.released; });
  }
  if (g_s.ipc.empty()) return -1;
  fake_ese::IpcReply r = g_s.ipc.front();
  g_s.ipc.pop_front();
  const size_t n = std::min<size_t>(r.bytes.size(), 270);  // the caller's buffer
  if (n) std::memcpy(rsp->p_data, r.bytes.data(), n);
  rsp->len = static_cast<uint32_t>(r.reportedLen >= 0 ? r.reportedLen : static_cast<long>(n));
  return r.rc;
}

int32_t phQvEse_7816_Transceive(phQvEse_7816_cpdu* c, phQvEse_7816_rpdu* r) {
  fake_ese::Lock l(g_s.mu);
  char buf[96];
  std::snprintf(buf, sizeof(buf), "trx %02X %02X %02X %02X lc=%u", c->cla, c->ins, c->p1, c->p2,
                static_cast<unsigned>(c->lc));
  std::string line = buf;
  if (c->lc) line += " " + fake_ese::hexBytes(c->pdata, c->lc);
  std::snprintf(buf, sizeof(buf), " le_type=%u le=%u rlen=%u", c->le_type, c->le,
                static_cast<unsigned>(r->len));
  fake_ese::record(line + buf);
  if (g_s.trx.empty()) return -1;
  fake_ese::TransceiveReply rep = g_s.trx.front();
  g_s.trx.pop_front();
  const size_t n = std::min<size_t>(rep.data.size(), 256);  // the smaller caller buffer
  if (n) std::memcpy(r->pdata, rep.data.data(), n);
  r->len = static_cast<uint16_t>(rep.reportedLen >= 0 ? rep.reportedLen : static_cast<long>(n));
  r->sw1 = rep.sw1;
  r->sw2 = rep.sw2;
  return rep.rc;
}

}  // extern "C"

#pragma once
// A scripted stand-in for the vendor eSE library, linked into test programs in
// place of libese_qv_hal.so. Each exchange function answers from its own queue
// of scripted replies (a failure when the queue is empty) and every call is
// written to a call log as one line of text, so a test can compare the whole
// conversation with the library in one assertion.
#include <cstdint>
#include <string>
#include <vector>

namespace fake_ese {

// One reply of phQVNciHal_Transmit_APDU_by_IPC: `bytes` are written into the
// caller's 270-byte buffer; `reportedLen`, when not negative, is put in `len`
// instead of the number of bytes written.
struct IpcReply {
  int32_t rc = 0;
  std::vector<uint8_t> bytes;
  long reportedLen = -1;
};

// One reply of phQvEse_7816_Transceive: `data` goes to the caller's buffer,
// SW1 SW2 into the record (also when rc is not 0).
struct TransceiveReply {
  int32_t rc = 0;
  std::vector<uint8_t> data;
  uint8_t sw1 = 0x90;
  uint8_t sw2 = 0x00;
  long reportedLen = -1;
};

// Back to the defaults: empty queues and log, every plain call answering 0,
// the eSE type 1.
void reset();

void queueIpc(const IpcReply& reply);
void queueTransceive(const TransceiveReply& reply);
void setReadyResult(int32_t rc);        // phQVNciHal_Set_KORVA_READY
void setReadyStatus(int32_t status);    // phQVNciHal_Get_KORVA_Ready_Status
void setInitOpenResult(int32_t rc);     // phQvEse_init_open
void setEseType(int32_t type);          // get_korva_exist_flag

// The calls so far, one line each:
//   "type" "open" "close" "ready" "status" "power korva_poweroff"
//   "ipc 00 70 00 00 01"                          (the command bytes)
//   "trx 01 A4 04 00 lc=2 A0 01 le_type=1 le=256 rlen=2"
//   "trx 02 70 80 02 lc=0 le_type=0 le=36864 rlen=0"
std::vector<std::string> calls();
void clearCalls();

// The next IPC exchange reports that it has begun, then waits until
// releaseBlockedIpc() before it answers, so a test can hold the eSE lock.
void blockNextIpc();
// Waits (up to timeoutMs) for the blocked exchange to begin.
bool waitIpcBlocked(int timeoutMs);
void releaseBlockedIpc();

// Waits (up to timeoutMs) until a call log line equal to `line` appears.
bool waitForCall(const std::string& line, int timeoutMs);

// Hex of bytes as the call log writes them: "00 A4 04 00".
std::string hex(const std::vector<uint8_t>& bytes);

}  // namespace fake_ese

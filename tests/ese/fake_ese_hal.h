#pragma once
// A scripted stand-in for the vendor eSE library, linked in place of
// libese_qv_hal.so. Each exchange answers from its own queue (a failure when
// empty); every call is one line of one call log, so that a test compares the
// whole conversation, its own result callbacks included, at once.
#include <cstdint>
#include <string>
#include <vector>

namespace fake_ese {

// phQVNciHal_Transmit_APDU_by_IPC: `bytes` go into the caller's 270-byte
// buffer; `reportedLen`, when not negative, is put in `len` instead.
struct IpcReply {
  int32_t rc = 0;
  std::vector<uint8_t> bytes;
  long reportedLen = -1;
};

// phQvEse_7816_Transceive: `data` into the caller's buffer, SW1 SW2 into the
// record (also when rc is not 0).
struct TransceiveReply {
  int32_t rc = 0;
  std::vector<uint8_t> data;
  uint8_t sw1 = 0x90;
  uint8_t sw2 = 0x00;
  long reportedLen = -1;
};

void reset();  // empty queues and log, every plain call answering 0, eSE type 1
void queueIpc(const IpcReply& reply);
void queueTransceive(const TransceiveReply& reply);
void setReadyResult(int32_t rc);      // phQVNciHal_Set_KORVA_READY
void setReadyStatus(int32_t status);  // phQVNciHal_Get_KORVA_Ready_Status
void setInitOpenResult(int32_t rc);   // phQvEse_init_open
void setEseType(int32_t type);        // get_korva_exist_flag

// One line per call: "type" "open" "close" "ready" "status" "power korva_poweroff",
// "ipc 00 70 00 00 01" (the command), "trx 01 A4 04 00 lc=2 A0 01 le_type=1
// le=256 rlen=2" (the record); and what a test notes, e.g. "result".
std::vector<std::string> calls();
void clearCalls();
void note(const std::string& line);

// The next IPC exchange waits inside the library until releaseBlockedIpc().
void blockNextIpc();
bool waitIpcBlocked(int timeoutMs);
void releaseBlockedIpc();

std::string hex(const std::vector<uint8_t>& bytes);  // "00 A4 04 00"

}  // namespace fake_ese

#pragma once
// AT command channel: one context per modem AT port, bound to the thread that
// opened it (and to the port's reader thread). Every call addresses the port
// of the calling thread.
#include <cstdint>

#include "se_modem_id.h"  // g_ulModemId, defined in se_common; printed in log lines only

struct ATResponseLine {
  ATResponseLine* next;  // owned; null at the end
  char* text;            // owned heap copy of the line
};

struct ATResponse {
  int32_t success;                  // 1 for "OK"/"CONNECT", 0 for an error or a closed channel
  char* final_response;             // owned; null when the command ended without one
  ATResponseLine* p_intermediates;  // owned; arrival order once handed to the caller
};

// Unsolicited line handler: `s` is the line, `sms_pdu` the second line of an
// SMS-type pair or null. Both are lent for the duration of the call.
typedef void (*AtUnsolHandler)(const char* s, const char* sms_pdu);
typedef void (*AtTimeoutCallback)(void);

enum ATCommandType {
  at_type_none = 0,
  at_type_singleline = 2,
  // Like singleline, but a line made only of digits also counts as the
  // intermediate line: 3GPP TS 27.007 lets a modem answer AT+CCHO with the
  // bare session id instead of "+CCHO: <id>".
  at_type_singleline_or_numeric = 3,
};

// Results of the send operations.
enum {
  AT_OK = 0,
  AT_ERROR_GENERIC = -1,           // no context, or no memory for the response
  AT_ERROR_COMMAND_PENDING = -2,   // a response record was still pending
  AT_ERROR_CHANNEL_CLOSED = -3,    // port closed before the write or during the wait
  AT_ERROR_TIMEOUT = -4,           // no final response within the time-out
  AT_ERROR_INVALID_THREAD = -5,    // called on the port's reader thread
  AT_ERROR_INVALID_RESPONSE = -6,  // singleline: success without an intermediate line
  AT_ERROR_WRITE_FAILED = -7,      // not written in five attempts
};

int32_t at_open(int32_t fd, AtUnsolHandler h, int32_t index);
void at_close(void);

int32_t at_send_command(const char* command, ATResponse** pp_outResponse);
int32_t at_send_command_singleline(const char* command, const char* responsePrefix,
                                   ATResponse** pp_outResponse);
// As at_send_command_singleline, for commands whose answer may also be a
// bare number on its own line (at_type_singleline_or_numeric).
int32_t at_send_command_singleline_or_numeric(const char* command, const char* responsePrefix,
                                              ATResponse** pp_outResponse);
void at_response_free(ATResponse* p_response);
void at_set_on_timeout(AtTimeoutCallback onTimeout);
int32_t at_get_cme_error(const ATResponse* p_response);

// Modem index of the calling thread's context, -1 when it has none.
int32_t get_ac_index(void);

// The number of the port opening the calling thread's port came from (the
// at_open calls for its modem index, counted over the process; 0 when the
// thread has no port): what a handler learned about the modem behind the
// port holds only while this number stays the same. Logs nothing.
uint32_t at_open_count(void);

// 1 when the calling thread's port is closed (at_close ran, or the reader
// ended because the port failed, hung up or stayed at end of file) or the
// thread has no port; 0 while it is usable. Logs nothing.
int32_t at_is_closed(void);

// How long, in microseconds, the command pending on modem `index`'s port
// has gone without a line of its answer (counted from its write); 0 when no
// command is pending there. Any thread may ask: the SIM front uses it to
// tell a modem that is working from one that has gone silent.
int64_t at_silence_micros(int32_t index);

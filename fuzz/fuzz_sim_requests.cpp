// Each SIM request handler for arbitrary request inputs, fed arbitrary modem
// answers. The AT layer below the handlers is a fake linked into this target
// only: every command is answered from the fuzz input with a result code, a
// final line (OK, ERROR, +CME ERROR: n, ...) and intermediate lines, built
// the way the real channel hands them out (heap copies the caller frees).
#include <at_tok.h>
#include <atchannel.h>
#include <host/log_capture.h>

#include "async_cmd.h"
#include "fuzz_util.h"

namespace {

int32_t g_acIndex = 0;
int g_sends = 0;

char* heapCopy(const std::string& s) {
  char* p = static_cast<char*>(malloc(s.size() + 1));
  if (p == nullptr) abort();
  memcpy(p, s.c_str(), s.size() + 1);  // c_str: stops the copy at the first NUL's terminator
  return p;
}

std::string finalLine(FuzzedDataProvider& in) {
  switch (in.ConsumeIntegralInRange<int>(0, 5)) {
    case 0: return "OK";
    case 1: return "ERROR";
    case 2: return "+CME ERROR: " + std::to_string(in.ConsumeIntegral<int32_t>());
    case 3: {
      static const int kKnown[] = {716, 717, 760, 3, 10};
      return "+CME ERROR: " + std::to_string(kKnown[in.ConsumeIntegralInRange<int>(0, 4)]);
    }
    case 4: {
      if (in.ConsumeBool()) return "+CME ERROR:" + in.ConsumeRandomLengthString(16);
      static const char* const kVerbose[] = {"SIM not inserted", "operation not supported",
                                             "operation not allowed", "unknown"};
      return std::string("+CME ERROR: ") + kVerbose[in.ConsumeIntegralInRange<int>(0, 3)];
    }
    default: return in.ConsumeRandomLengthString(16);
  }
}

// An intermediate line: mostly the expected prefix with fuzzed fields, so
// that the tokenizer paths of each handler are reached quickly.
std::string intermediateLine(FuzzedDataProvider& in, const char* prefix) {
  std::string tail = in.ConsumeRandomLengthString(700);
  switch (in.ConsumeIntegralInRange<int>(0, 3)) {
    case 0: return std::string(prefix ? prefix : "") + tail;
    case 1: {
      // "<prefix> <len>,"<hex>"" with a length that may lie about the text.
      int32_t n = in.ConsumeIntegral<int32_t>();
      if (in.ConsumeBool()) n = static_cast<int32_t>(tail.size()) + in.ConsumeIntegralInRange<int32_t>(-2, 2);
      return std::string(prefix ? prefix : "") + " " + std::to_string(n) + ",\"" + tail + "\"";
    }
    case 2: {
      // A well-formed hex answer of the chosen byte count.
      size_t bytes = in.ConsumeIntegralInRange<size_t>(0, 300);
      std::string hex;
      for (size_t i = 0; i < bytes; ++i) hex += "9A";
      return std::string(prefix ? prefix : "") + " " + std::to_string(hex.size()) + ",\"" + hex + "\"";
    }
    default: return tail;
  }
}

int32_t answer(const char* command, const char* prefix, ATResponse** out) {
  if (command == nullptr || out == nullptr) abort();
  // A command line must be a terminated string the port can take.
  if (strnlen(command, 1024) >= 1024) abort();
  ++g_sends;
  *out = nullptr;
  FuzzedDataProvider& in = *fuzz::input();
  static const int32_t kErrors[] = {AT_OK,
                                    AT_ERROR_GENERIC,
                                    AT_ERROR_COMMAND_PENDING,
                                    AT_ERROR_CHANNEL_CLOSED,
                                    AT_ERROR_TIMEOUT,
                                    AT_ERROR_INVALID_THREAD,
                                    AT_ERROR_INVALID_RESPONSE,
                                    AT_ERROR_WRITE_FAILED};
  int32_t err = in.remaining_bytes() == 0 ? AT_ERROR_CHANNEL_CLOSED
                                          : kErrors[in.ConsumeIntegralInRange<int>(0, 7)];
  // A closed channel or a time-out may still leave a partial response.
  if (err != AT_OK && err != AT_ERROR_CHANNEL_CLOSED && err != AT_ERROR_TIMEOUT) return err;
  if (err != AT_OK && in.ConsumeBool()) return err;
  ATResponse* r = static_cast<ATResponse*>(calloc(1, sizeof(ATResponse)));
  if (r == nullptr) abort();
  const int lines = in.ConsumeIntegralInRange<int>(0, 2);
  ATResponseLine** tail = &r->p_intermediates;
  for (int i = 0; i < lines; ++i) {
    ATResponseLine* l = static_cast<ATResponseLine*>(calloc(1, sizeof(ATResponseLine)));
    if (l == nullptr) abort();
    l->text = heapCopy(intermediateLine(in, prefix));
    *tail = l;
    tail = &l->next;
  }
  if (err == AT_OK || in.ConsumeBool()) {
    r->final_response = heapCopy(finalLine(in));
    r->success = (strcmp(r->final_response, "OK") == 0) ? 1 : 0;
  }
  // The real singleline send turns success without a line into an error.
  if (prefix != nullptr && err == AT_OK && r->success && r->p_intermediates == nullptr) {
    at_response_free(r);
    return AT_ERROR_INVALID_RESPONSE;
  }
  *out = r;
  return err;
}

}  // namespace

// The fake channel. The handlers run where a port context exists; the
// context's modem index comes from the input.
int32_t at_send_command(const char* command, ATResponse** pp_outResponse) {
  return answer(command, nullptr, pp_outResponse);
}

int32_t at_send_command_singleline(const char* command, const char* responsePrefix,
                                   ATResponse** pp_outResponse) {
  if (responsePrefix == nullptr) abort();
  return answer(command, responsePrefix, pp_outResponse);
}

// The open answer may also be the bare session id.
int32_t at_send_command_singleline_or_numeric(const char* command, const char* responsePrefix,
                                              ATResponse** pp_outResponse) {
  if (responsePrefix == nullptr) abort();
  FuzzedDataProvider& in = *fuzz::input();
  if (in.remaining_bytes() > 0 && in.ConsumeBool()) {
    int32_t err = answer(command, "", pp_outResponse);
    return err;
  }
  return answer(command, responsePrefix, pp_outResponse);
}

int32_t get_ac_index(void) { return g_acIndex; }
// The port opening is chosen per input, so that what one input's handlers
// learned about a modem is sometimes kept for the next and sometimes not.
uint32_t g_opening = 1;
uint32_t at_open_count(void) { return g_opening; }

// The worker's port handling is not reached from the handlers.
int32_t at_open(int32_t, AtUnsolHandler, int32_t) { abort(); }
void at_close(void) { abort(); }
void at_set_on_timeout(AtTimeoutCallback) {}
int32_t at_is_closed(void) { abort(); }
int64_t at_silence_micros(int32_t) { return 0; }
int asyncCmdOpenPort(const char*) { abort(); }

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  android::host::LogCapture quiet;
  FuzzedDataProvider in(data, size);
  fuzz::CurrentInput current(in);
  g_sends = 0;
  static const int32_t kIndexes[] = {0, 1, -1};
  g_acIndex = kIndexes[in.ConsumeIntegralInRange<int>(0, 2)];
  if (in.ConsumeBool()) ++g_opening;

  // Session tables as earlier opens may have left them.
  for (auto& table : sessionTable) {
    for (int32_t& s : table) s = 0;
  }
  curSessionTable = sessionTable[0];
  const int opened = in.ConsumeIntegralInRange<int>(0, 4);
  for (int i = 0; i < opened; ++i) {
    int m = in.ConsumeIntegralInRange<int>(0, ASYNC_CMD_MODEM_MAX - 1);
    int c = in.ConsumeIntegralInRange<int>(0, SESSION_TABLE_SIZE - 1);
    sessionTable[m][c] = in.ConsumeIntegral<int32_t>();
  }

  // The request as asyncCmdPush leaves it: datalen within the record.
  static const int32_t kRequests[] = {REQUEST_GET_CARD_PRESENT, REQUEST_GET_ATR,
                                      REQUEST_OPEN_LOGICAL_CHANNEL, REQUEST_TRANSMIT_APDU,
                                      REQUEST_CLOSE_LOGICAL_CHANNEL, 3};
  const int32_t request = kRequests[in.ConsumeIntegralInRange<int>(0, 5)];
  g_asyncCmd.modem_id = g_acIndex < 0 ? 0 : g_acIndex;
  g_asyncCmd.request = request;
  g_asyncCmd.param = in.ConsumeBool() ? in.ConsumeIntegralInRange<int32_t>(0, 255)
                                      : in.ConsumeIntegral<int32_t>();
  g_asyncCmd.datalen = in.ConsumeIntegralInRange<int32_t>(0, ASYNC_CMD_DATA_MAX);
  memset(g_asyncCmd.data, 0, sizeof(g_asyncCmd.data));
  std::string bytes = in.ConsumeBytesAsString(static_cast<size_t>(g_asyncCmd.datalen));
  if (!bytes.empty()) memcpy(g_asyncCmd.data, bytes.data(), bytes.size());
  g_asyncCmd.state = CMD_STATE_REQUEST;

  processRequest();

  // What the SIM front relies on: on success a length that fits the record
  // (a negative one, from an undecodable answer, it treats as no data).
  if (request == REQUEST_GET_ATR || request == REQUEST_TRANSMIT_APDU) {
    if (g_asyncCmd.param == 0 && g_asyncCmd.datalen > ASYNC_CMD_DATA_MAX) abort();
  }
  if (request == REQUEST_OPEN_LOGICAL_CHANNEL && g_asyncCmd.param == 0) {
    if (g_asyncCmd.datalen > ASYNC_CMD_SELECT_RESP_MAX) abort();
    const int32_t channel = g_asyncCmd.data[0];
    if (channel < 1 || channel >= SESSION_TABLE_SIZE) abort();
  }
  g_asyncCmd.state = CMD_STATE_IDLE;
  return 0;
}

// Handlers of the SIM requests: card presence, ATR, logical channels and
// APDU transmit. They run on the worker of g_asyncCmd.modem_id, so their AT
// commands reach that modem's port.
#include <at_tok.h>
#include <securec.h>

#include <strings.h>

#include <cstring>

#include "async_cmd.h"
#include "session_release.h"
#include "qv_log.h"

int32_t sessionTable[ASYNC_CMD_MODEM_MAX][SESSION_TABLE_SIZE];
int32_t* curSessionTable = sessionTable[0];

namespace {

constexpr size_t kOpenCmdSize = 120;
constexpr size_t kTransmitCmdSize = 600;
// Both open commands begin with 9 characters: AT+CCHO=" or AT+CCHP=".
constexpr size_t kOpenCmdPrefixLen = 9;
constexpr int32_t kAidMaxLen = 52;
constexpr int32_t kP2OpenWithoutP2 = 0x7F;

// Owns one AT response and frees it when the handler is done with its text.
class ResponseHolder {
 public:
  ResponseHolder() = default;
  ~ResponseHolder() { at_response_free(mResponse); }
  ResponseHolder(const ResponseHolder&) = delete;
  ResponseHolder& operator=(const ResponseHolder&) = delete;
  ATResponse** out() { return &mResponse; }
  ATResponse* get() const { return mResponse; }

 private:
  ATResponse* mResponse = nullptr;
};

// The single-line exchange succeeded: non-negative result, a response with
// success set and at least one intermediate line.
bool exchangeOk(int32_t err, const ATResponse* response) {
  return err >= 0 && response != nullptr && response->success != 0 &&
         response->p_intermediates != nullptr && response->p_intermediates->text != nullptr;
}

void logExchangeFailure(const char* fn, int32_t err, const ATResponse* response) {
  QV_LOGE("%s:%s return errno=%d, p_response=%p(success=%d, p_intermediates=%p)", fn, "cmd", err,
          static_cast<const void*>(response), response ? response->success : 0,
          response ? static_cast<const void*>(response->p_intermediates) : nullptr);
}

// Reads "<prefix> <length>,<hex>" of a +CGLA:/+CSIM: answer. On success
// `hex` points into the line and `n` is the usable hex length (the given
// length lowered to the text's own).
bool readHexAnswer(const char* fn, char* line, const char** hex, int32_t* n) {
  int32_t responseLength = 0;
  char* responseStr = nullptr;
  if (at_tok_start(&line) < 0) {
    QV_LOGE("%s: %s\n", fn, "at_tok_start(&line) error");
    return false;
  }
  if (at_tok_nextint(&line, &responseLength) < 0) {
    QV_LOGE("%s: %s\n", fn, "at_tok_nextint(&p_line, &response_length) error");
    return false;
  }
  if (at_tok_nextstr(&line, &responseStr) < 0 || responseStr == nullptr) {
    QV_LOGE("%s: %s\n", fn, "at_tok_nextstr(&p_line, &(response_str)) error");
    return false;
  }
  const size_t textLen = strlen(responseStr);
  if (responseLength >= 0 && textLen > static_cast<size_t>(responseLength)) {
    // Cutting the text to the length would drop the status word.
    QV_LOGE("%s, length %d shorter than the %zu hex digits given", fn, responseLength, textLen);
    return false;
  }
  if (textLen == 2) {
    // One byte cannot hold the status word every response ends with.
    QV_LOGE("%s, one-byte answer has no status word", fn);
    return false;
  }
  *hex = responseStr;
  // A negative length stays negative so that the decoding reports it; a
  // longer one is lowered to the text's length.
  *n = responseLength < 0 ? responseLength : static_cast<int32_t>(textLen);
  return true;
}

// The SELECT by AID on the new session. Returns the status of the open;
// *portAnswers is false when the exchange timed out or found the port
// closed, where a release command would only wait in vain as well.
int32_t transmit_select_cmd(int32_t channel, int32_t aidLen, int32_t selectP2,
                            const char* openCmd, bool* portAnswers) {
  *portAnswers = true;
  static const char* const kFn = "transmit_select_cmd";
  char aidHex[2 * kAidMaxLen + 1];
  (void)memset_s(aidHex, sizeof(aidHex), 0, sizeof(aidHex));
  (void)memcpy_s(aidHex, sizeof(aidHex) - 1, openCmd + kOpenCmdPrefixLen,
                 static_cast<size_t>(2 * aidLen));

  char* cmd = reinterpret_cast<char*>(g_asyncCmd.data);
  (void)memset_s(g_asyncCmd.data, sizeof(g_asyncCmd.data), 0, sizeof(g_asyncCmd.data));
  if (snprintf_s(cmd, sizeof(g_asyncCmd.data), sizeof(g_asyncCmd.data) - 1,
                 "AT+CGLA=%d,%d,\"00A404%02X%02X%s\"", curSessionTable[channel], 2 * aidLen + 10,
                 static_cast<unsigned>(selectP2), static_cast<unsigned>(aidLen), aidHex) < 1) {
    return 1;
  }

  ResponseHolder response;
  int32_t err = at_send_command_singleline(cmd, "+CGLA:", response.out());
  if (!exchangeOk(err, response.get())) {
    logExchangeFailure(kFn, err, response.get());
    *portAnswers = err != AT_ERROR_CHANNEL_CLOSED && err != AT_ERROR_TIMEOUT;
    return 1;
  }
  const char* hex = nullptr;
  int32_t n = 0;
  if (!readHexAnswer(kFn, response.get()->p_intermediates->text, &hex, &n)) return 1;
  if (n / 2 > ASYNC_CMD_SELECT_RESP_MAX) {
    // Cutting it would hand the caller a corrupted select response.
    QV_LOGE("%s, select response of %d hex digits exceeds %d bytes", kFn, n,
            ASYNC_CMD_SELECT_RESP_MAX);
    return 1;
  }
  (void)memset_s(g_asyncCmd.data, sizeof(g_asyncCmd.data), 0, sizeof(g_asyncCmd.data));
  g_asyncCmd.data[0] = static_cast<uint8_t>(channel);
  g_asyncCmd.datalen = hexDecode(hex, n, g_asyncCmd.data + 1, ASYNC_CMD_SELECT_RESP_MAX);
  return 0;
}

int32_t cmeErrorToStatus(int32_t cmeErr) {
  switch (cmeErr) {
    case 716: return 3;  // no such applet
    case 717: return 2;  // no channel free
    case 760: return 5;  // card error
    default: return 1;
  }
}

}  // namespace

void adjust_session(void) {
  int32_t m = get_ac_index();
  QV_LOGE("%s, modem_id: %d", "adjust_session", m);
  if (m == 0 || m == 1) {
    curSessionTable = sessionTable[m];
  } else {
    QV_LOGE("%s, modem_id: %d is invalid", "adjust_session", m);
  }
}

void clear_session_table(int32_t modem_id) {
  if (modem_id < 0 || modem_id >= ASYNC_CMD_MODEM_MAX) return;
  for (int32_t& session : sessionTable[modem_id]) session = 0;
}

// ---- card presence and ATR ------------------------------------------------
//
// Not every modem knows the vendor queries AT^CARDTYPE? and AT^CARDATR. One
// that answers them as an unknown command is asked the standard AT+CPIN?
// for presence instead, and gives no ATR. What a port's modem lacks is
// learned once per port opening: a port opened again may be another modem.

namespace {

enum class Support { kUnknown, kYes, kNo };

struct ModemQueries {
  uint32_t opening = 0;  // at_open_count() of the port this was learned on
  Support cardType = Support::kUnknown;
  Support cardAtr = Support::kUnknown;
};

// One per modem; each is touched only by that modem's worker.
ModemQueries g_queries[ASYNC_CMD_MODEM_MAX];

ModemQueries& queriesOfThisPort() {
  static ModemQueries unused;  // a modem id out of range learns nothing lasting
  const int32_t m = g_asyncCmd.modem_id;
  ModemQueries& q = (m >= 0 && m < ASYNC_CMD_MODEM_MAX) ? g_queries[m] : unused;
  const uint32_t opening = at_open_count();
  if (q.opening != opening) q = ModemQueries{opening, Support::kUnknown, Support::kUnknown};
  return q;
}

// The text after "+CME ERROR:" when it is not a number (AT+CMEE=2), else null.
const char* verboseCmeText(const char* final) {
  static const char kCme[] = "+CME ERROR:";
  if (final == nullptr || strncmp(final, kCme, sizeof(kCme) - 1) != 0) return nullptr;
  const char* text = final + sizeof(kCme) - 1;
  while (*text == ' ') ++text;
  return (*text >= '0' && *text <= '9') ? nullptr : text;
}

// The 3GPP TS 27.007 error an answer carries, numeric or verbose; -1 for
// none that is known here.
int32_t cmeCode(const ATResponse* response) {
  const int32_t numeric = at_get_cme_error(response);
  if (numeric > 0) return numeric;
  const char* text = verboseCmeText(response ? response->final_response : nullptr);
  if (text == nullptr) return -1;
  static const struct {
    int32_t code;
    const char* text;
  } kVerbose[] = {{3, "operation not allowed"}, {4, "operation not supported"}, {10, "SIM not inserted"}};
  for (const auto& v : kVerbose) {
    if (strcasecmp(text, v.text) == 0) return v.code;
  }
  return -1;
}

bool bareError(const ATResponse* response) {
  return response != nullptr && response->final_response != nullptr &&
         strcmp(response->final_response, "ERROR") == 0;
}

// The modem answered, and its answer says it does not know the command: a
// bare ERROR (AT+CMEE=0, or how most modems answer an unknown command),
// COMMAND NOT SUPPORT, or the errors 3 and 4 in either form.
bool refusedAsUnknown(int32_t err, const ATResponse* response) {
  if (err < 0 || response == nullptr || response->success != 0) return false;
  if (bareError(response)) return true;
  const char* final = response->final_response;
  if (final != nullptr && strncmp(final, "COMMAND NOT SUPPORT", 19) == 0) return true;
  const int32_t code = cmeCode(response);
  return code == 3 || code == 4;
}

const char* finalText(const ATResponse* response) {
  return (response && response->final_response) ? response->final_response : "(none)";
}

// Presence by AT^CARDTYPE?: 1 or 0, or -1 when the modem does not know the
// query (learned for this port).
// Presence not known: the modem gave no answer.
constexpr int32_t kPresenceUnknown = -2;

int32_t presenceByCardType(ModemQueries& q) {
  static const char* const kFn = "request_get_card_present";
  ResponseHolder response;
  int32_t err = at_send_command_singleline("AT^CARDTYPE?", "^CARDTYPE:", response.out());
  if (!exchangeOk(err, response.get())) {
    if (refusedAsUnknown(err, response.get())) {
      q.cardType = Support::kNo;
      QV_LOGI("%s, the modem does not know AT^CARDTYPE? (%s): presence from AT+CPIN? on this port",
              kFn, finalText(response.get()));
      return -1;
    }
    // Any other final answer (no card, say) comes from a modem that knows it.
    if (err >= 0 && response.get() != nullptr && response.get()->final_response != nullptr) {
      q.cardType = Support::kYes;
      return 0;
    }
    // No answer at all (time-out, port gone): nothing is known of the card.
    return kPresenceUnknown;
  }
  q.cardType = Support::kYes;
  char* line = response.get()->p_intermediates->text;
  int32_t cardmode = 0;
  int32_t hasC = 0;
  int32_t hasG = 0;
  if (at_tok_start(&line) < 0) {
    QV_LOGE("%s: %s\n", kFn, "at_tok_start(&line) failed");
  } else if (at_tok_nextint(&line, &cardmode) < 0) {
    QV_LOGE("%s: %s\n", kFn, "at_tok_nextint cardmode failed");
  } else if (at_tok_nextint(&line, &hasC) < 0) {
    QV_LOGE("%s: %s\n", kFn, "at_tok_nextint has_c failed");
  } else if (at_tok_nextint(&line, &hasG) < 0) {
    QV_LOGE("%s: %s\n", kFn, "at_tok_nextint has_g failed");
  } else {
    // A 32-bit sum that wraps as the modem's own arithmetic does, without
    // the undefined overflow of a signed addition.
    int32_t sum = static_cast<int32_t>(static_cast<uint32_t>(hasC) + static_cast<uint32_t>(hasG));
    return (cardmode >= 1 && sum > 0) ? 1 : 0;
  }
  return 0;
}

// Presence by AT+CPIN? (3GPP TS 27.007): any +CPIN: answer (READY, SIM PIN,
// SIM PUK, ...) means a card is there; error 10, "SIM not inserted", means
// none; any other failure counts as none too.
int32_t presenceByPin() {
  static const char* const kFn = "request_get_card_present";
  ResponseHolder response;
  int32_t err = at_send_command_singleline("AT+CPIN?", "+CPIN:", response.out());
  if (exchangeOk(err, response.get())) return 1;
  if (err >= 0 && cmeCode(response.get()) == 10) return 0;
  if (err < 0) return kPresenceUnknown;
  QV_LOGE("%s, AT+CPIN? failed (err %d, %s): card counted as absent", kFn, err,
          finalText(response.get()));
  return 0;
}

}  // namespace

void request_get_card_present(void) {
  static const char* const kFn = "request_get_card_present";
  QV_LOGD("%s, enter, g_ulModemId: %d", kFn, static_cast<int32_t>(g_ulModemId));
  ModemQueries& q = queriesOfThisPort();
  int32_t present = q.cardType == Support::kNo ? -1 : presenceByCardType(q);
  if (present == -1) present = presenceByPin();
  // A modem that did not answer leaves presence unknown (below 0): the
  // front reports a failure, not an absent card.
  g_asyncCmd.param = present;
}

namespace {

// Whether the modem knows AT^CARDATR, judged from an answer that failed. A
// bare ERROR may also mean that no card is there: it counts as "unknown
// command" only on a modem that lacks the other vendor query too.
bool atrQueryUnknown(ModemQueries& q, int32_t err, const ATResponse* response) {
  if (!refusedAsUnknown(err, response)) return false;
  if (!bareError(response)) return true;
  if (q.cardType == Support::kUnknown) (void)presenceByCardType(q);
  return q.cardType == Support::kNo;
}

}  // namespace

void request_get_atr(void) {
  static const char* const kFn = "request_get_atr";
  QV_LOGD("%s, enter, g_ulModemId: %d", kFn, static_cast<int32_t>(g_ulModemId));
  ModemQueries& q = queriesOfThisPort();
  ResponseHolder response;
  const char* cardatr = nullptr;
  if (q.cardAtr != Support::kNo) {
    int32_t err = at_send_command_singleline("AT^CARDATR", "^CARDATR:", response.out());
    if (!exchangeOk(err, response.get())) {
      if (atrQueryUnknown(q, err, response.get())) {
        q.cardAtr = Support::kNo;
        QV_LOGI("%s, the modem does not know AT^CARDATR (%s) and has no other ATR query: "
                "getAtr gives an empty ATR on this port", kFn, finalText(response.get()));
      } else {
        logExchangeFailure(kFn, err, response.get());
      }
    } else {
      q.cardAtr = Support::kYes;
      char* line = response.get()->p_intermediates->text;
      char* text = nullptr;
      if (at_tok_start(&line) < 0) {
        QV_LOGE("%s: %s\n", kFn, "at_tok_start(&line) failed");
      } else if (at_tok_nextstr(&line, &text) < 0) {
        QV_LOGE("%s: %s\n", kFn, "at_tok_nextstr(&line, &p_cardatr) failed");
      } else if (text == nullptr) {
        QV_LOGE("%s, p_cardatr is NULL", kFn);
      } else {
        cardatr = text;
      }
    }
  }
  size_t n = cardatr ? strlen(cardatr) : 0;
  (void)memset_s(g_asyncCmd.data, sizeof(g_asyncCmd.data), 0, sizeof(g_asyncCmd.data));
  if (q.cardAtr == Support::kNo) {
    // No ATR query on this modem: an empty ATR is the answer, not a failure.
    g_asyncCmd.param = 0;
    g_asyncCmd.datalen = 0;
  } else if (n < 1) {
    g_asyncCmd.param = 1;
    g_asyncCmd.datalen = 0;
  } else if (n / 2 > ASYNC_CMD_DATA_MAX) {
    // A cut ATR would be a corrupted one: refuse it.
    QV_LOGE("%s, atr of %zu hex digits exceeds %d bytes", kFn, n, ASYNC_CMD_DATA_MAX);
    g_asyncCmd.param = 1;
    g_asyncCmd.datalen = 0;
  } else {
    g_asyncCmd.param = 0;
    g_asyncCmd.datalen =
        hexDecode(cardatr, static_cast<int32_t>(n), g_asyncCmd.data, sizeof(g_asyncCmd.data));
  }
}

void request_open_logical_channel(void) {
  static const char* const kFn = "request_open_logical_channel";
  const int32_t p2 = g_asyncCmd.param;
  const int32_t aidLen = g_asyncCmd.datalen;
  QV_LOGD("%s, enter, g_ulModemId: %d, p2: %d", kFn, static_cast<int32_t>(g_ulModemId), p2);
  if (aidLen < 1) {
    QV_LOGE("%s, aid size: %d error", kFn, aidLen);
    g_asyncCmd.param = 1;
    return;
  }
  if (aidLen > kAidMaxLen) {
    QV_LOGE("%s, aid size: %d too large", kFn, aidLen);
    g_asyncCmd.param = 1;
    return;
  }
  if (p2 < 0 || p2 > 255) {
    g_asyncCmd.param = 1;
    return;
  }

  char openCmd[kOpenCmdSize];
  (void)memset_s(openCmd, sizeof(openCmd), 0, sizeof(openCmd));
  const bool withoutP2 = p2 == kP2OpenWithoutP2;
  const char* prefix = withoutP2 ? "AT+CCHO=\"" : "AT+CCHP=\"";
  const char* responsePrefix = withoutP2 ? "+CCHO:" : "+CCHP:";
  const int32_t selectP2 = withoutP2 ? 0 : p2;
  int32_t pos = snprintf_s(openCmd, sizeof(openCmd), sizeof(openCmd) - 1, "%s", prefix);
  int32_t hexLen = pos < 1 ? -1
                           : hexEncode(g_asyncCmd.data, aidLen, openCmd + pos,
                                       sizeof(openCmd) - static_cast<size_t>(pos));
  if (hexLen < 0) {
    g_asyncCmd.param = 1;
    return;
  }
  pos += hexLen;
  int32_t tail = withoutP2 ? snprintf_s(openCmd + pos, sizeof(openCmd) - pos,
                                        sizeof(openCmd) - pos - 1, "\"")
                           : snprintf_s(openCmd + pos, sizeof(openCmd) - pos,
                                        sizeof(openCmd) - pos - 1, "\",%d", p2);
  if (tail < 1) {
    g_asyncCmd.param = 1;
    return;
  }

  // The session id may come bare on its line (3GPP TS 27.007's plain form)
  // as well as after the prefix.
  ResponseHolder openResponse;
  int32_t err = at_send_command_singleline_or_numeric(openCmd, responsePrefix, openResponse.out());
  if (err < 0 || openResponse.get() == nullptr || openResponse.get()->success == 0) {
    int32_t cmeErr = at_get_cme_error(openResponse.get());
    QV_LOGE("%s, cme_err: %d", kFn, cmeErr);
    g_asyncCmd.param = cmeErrorToStatus(cmeErr);
    return;
  }
  if (openResponse.get()->p_intermediates == nullptr ||
      openResponse.get()->p_intermediates->text == nullptr) {
    logExchangeFailure(kFn, err, openResponse.get());
    g_asyncCmd.param = 1;
    return;
  }
  char* line = openResponse.get()->p_intermediates->text;
  int32_t sessionId = 0;
  const bool bare = strncmp(line, responsePrefix, strlen(responsePrefix)) != 0;
  if (!bare && at_tok_start(&line) < 0) {
    QV_LOGE("%s: %s\n", kFn, "at_tok_start(&p_line) error");
    g_asyncCmd.param = 1;
    return;
  }
  if (at_tok_nextint(&line, &sessionId) < 0) {
    QV_LOGE("%s: %s\n", kFn, "at_tok_nextint(&p_line, &session_id) error");
    g_asyncCmd.param = 1;
    return;
  }
  QV_LOGD("%s, session_id: %d(0x%08X)", kFn, sessionId, static_cast<unsigned>(sessionId));
  int32_t channel = sessionId & 0x1F;
  if (channel == 0 || channel >= SESSION_TABLE_SIZE) {
    QV_LOGE("%s, modem channel %d is invalid", kFn, channel);
    // An id below 1 names no channel the modem could close.
    if (sessionId >= 1 && session_release_now(kFn, sessionId) < 0) {
      session_release_later(get_ac_index(), sessionId);
    }
    g_asyncCmd.param = 1;
    return;
  }
  adjust_session();
  curSessionTable[channel] = sessionId;

  bool portAnswers = true;
  int32_t status = transmit_select_cmd(channel, aidLen, selectP2, openCmd, &portAnswers);
  if (status != 0) {
    // A SELECT the modem did not answer leaves the session to release once
    // it answers again; waiting for it now would only time out as well. A
    // release the modem refuses keeps the entry for a later close.
    const int32_t released = portAnswers ? session_release_now(kFn, sessionId) : -1;
    if (released < 0) session_release_later(get_ac_index(), sessionId);
    if (released != 0) curSessionTable[channel] = 0;
  }
  g_asyncCmd.param = status;
}

void request_close_logical_channel(void) {
  static const char* const kFn = "request_close_logical_channel";
  QV_LOGD("%s, enter, g_ulModemId: %d", kFn, static_cast<int32_t>(g_ulModemId));
  int32_t channel = g_asyncCmd.param;
  if (channel < 1 || channel >= SESSION_TABLE_SIZE) {
    QV_LOGE("%s, channel %d is invalid", kFn, channel);
    g_asyncCmd.param = 1;
    return;
  }
  adjust_session();
  int32_t session = curSessionTable[channel];
  if (session < 1) {
    QV_LOGE("%s, channel %d's session id %d is invalid", kFn, channel, session);
    g_asyncCmd.param = 1;
    return;
  }
  char* cmd = reinterpret_cast<char*>(g_asyncCmd.data);
  (void)memset_s(g_asyncCmd.data, sizeof(g_asyncCmd.data), 0, sizeof(g_asyncCmd.data));
  if (snprintf_s(cmd, sizeof(g_asyncCmd.data), sizeof(g_asyncCmd.data) - 1, "AT+CCHC=%d",
                 session) < 1) {
    g_asyncCmd.param = 1;
    return;
  }
  ResponseHolder response;
  int32_t err = at_send_command(cmd, response.out());
  if (err < 0 || response.get() == nullptr) {
    QV_LOGE("%s, at send fail", kFn);
    // Not answered: the channel is gone for the client, the release is owed.
    session_release_later(get_ac_index(), session);
    curSessionTable[channel] = 0;
    g_asyncCmd.param = 1;
    return;
  }
  if (response.get()->success == 0) {
    QV_LOGE("%s, fail", kFn);
    g_asyncCmd.param = 1;
    return;
  }
  curSessionTable[channel] = 0;
  g_asyncCmd.param = 0;
}

void request_transmit_apdu(void) {
  static const char* const kFn = "request_transmit_apdu";
  QV_LOGD("%s, enter, g_ulModemId: %d", kFn, static_cast<int32_t>(g_ulModemId));
  g_asyncCmd.param = 1;
  const int32_t apduLen = g_asyncCmd.datalen;
  if (apduLen <= 3 || apduLen > ASYNC_CMD_DATA_MAX) {
    QV_LOGE("%s, datalen %d is invalid", kFn, apduLen);
    return;
  }
  const uint8_t cla = g_asyncCmd.data[0];
  const int32_t channel = (cla & 0x40) ? (cla & 0x0F) + 4 : (cla & 0x03);
  QV_LOGD("m%d %s, cla: 0x%02X, logic channel: %d", static_cast<int32_t>(g_ulModemId), kFn, cla, channel);
  adjust_session();

  char cmd[kTransmitCmdSize];
  (void)memset_s(cmd, sizeof(cmd), 0, sizeof(cmd));
  const char* responsePrefix;
  int32_t pos;
  if (channel != 0) {
    int32_t session = curSessionTable[channel];
    if (session < 1) {
      QV_LOGE("%s, channel %d is not open", kFn, channel);
      return;
    }
    responsePrefix = "+CGLA:";
    pos = snprintf_s(cmd, sizeof(cmd), sizeof(cmd) - 1, "AT+CGLA=%d,%d,\"", session, 2 * apduLen);
  } else {
    responsePrefix = "+CSIM:";
    pos = snprintf_s(cmd, sizeof(cmd), sizeof(cmd) - 1, "AT+CSIM=%d,\"", 2 * apduLen);
  }
  if (pos < 1) return;
  char* hex = cmd + pos;
  int32_t hexLen = hexEncode(g_asyncCmd.data, apduLen, hex, sizeof(cmd) - static_cast<size_t>(pos));
  if (hexLen < 0) return;
  QV_LOGD("%s, cmd: %10.10s", kFn, hex);
  if (snprintf_s(hex + hexLen, sizeof(cmd) - pos - hexLen, sizeof(cmd) - pos - hexLen - 1, "\"") <
      1) {
    return;
  }

  ResponseHolder response;
  int32_t err = at_send_command_singleline(cmd, responsePrefix, response.out());
  if (!exchangeOk(err, response.get())) {
    logExchangeFailure(kFn, err, response.get());
    return;
  }
  const char* answer = nullptr;
  int32_t n = 0;
  if (!readHexAnswer(kFn, response.get()->p_intermediates->text, &answer, &n)) return;
  if (n / 2 > ASYNC_CMD_DATA_MAX) {
    // A cut response APDU would lose its status word: refuse it instead.
    QV_LOGE("%s, response of %d hex digits exceeds %d bytes", kFn, n, ASYNC_CMD_DATA_MAX);
    return;
  }
  (void)memset_s(g_asyncCmd.data, sizeof(g_asyncCmd.data), 0, sizeof(g_asyncCmd.data));
  g_asyncCmd.datalen = hexDecode(answer, n, g_asyncCmd.data, sizeof(g_asyncCmd.data));
  g_asyncCmd.param = 0;
}

#pragma once
// The SIM request engine: one request record for the whole process, one
// worker thread per modem that owns the modem's AT port, and the handlers
// that turn requests into AT commands.
#include <pthread.h>

#include <atomic>
#include <cstddef>
#include <cstdint>

#include <atchannel.h>

#define ASYNC_CMD_MODEM_MAX 2
#define ASYNC_CMD_DATA_MAX 263
// Data area left for a select response after the channel byte.
#define ASYNC_CMD_SELECT_RESP_MAX (ASYNC_CMD_DATA_MAX - 1)

#define MODEM0_AT_DEV_PATH "/dev/appvcom18"
#define MODEM1_AT_DEV_PATH "/dev/appvcom34"

enum {
  CMD_STATE_IDLE = 0,
  CMD_STATE_REQUEST = 1,
  CMD_STATE_RESPONSE = 2,
};

enum {
  REQUEST_GET_CARD_PRESENT = 1,
  REQUEST_GET_ATR = 2,
  REQUEST_OPEN_LOGICAL_CHANNEL = 4,
  REQUEST_TRANSMIT_APDU = 5,
  REQUEST_CLOSE_LOGICAL_CHANNEL = 6,
};

// `modem_id` and `state` are atomic: both workers test them in their wait
// while a caller fills the record under the other modem's mutex. The other
// fields are touched only by the caller and by the worker the request is for,
// handed over under that worker's mutex.
struct AsyncCmdRecord {
  std::atomic<int32_t> modem_id;
  std::atomic<int32_t> state;
  int32_t request;
  int32_t param;
  int32_t datalen;
  uint8_t data[ASYNC_CMD_DATA_MAX];
};

struct AsyncCmdChannel {
  int32_t modem_id;
  int32_t running;
  char* dev_path;
  pthread_t thread;
  pthread_mutex_t mutex;
  pthread_cond_t req_cond;
  pthread_cond_t resp_cond;
  void (*handler)(void);
  AtUnsolHandler unsol_handler;
  AtTimeoutCallback timeout_handler;
};

typedef void (*RequestHandler)(void);
struct RequestTableEntry {
  int32_t request;
  RequestHandler handler;
};

// The one request record. Callers serialise among themselves (the SIM front
// holds its lock from writing `param` to reading the result).
extern AsyncCmdRecord g_asyncCmd;
extern AsyncCmdChannel g_asyncCmdChannel[ASYNC_CMD_MODEM_MAX];
// Written by the workers and read by callers on other threads, hence atomic.
extern std::atomic<int32_t> atPortOpened[ASYNC_CMD_MODEM_MAX];
extern std::atomic<int32_t> asyncCmdInited[ASYNC_CMD_MODEM_MAX];
extern const RequestTableEntry requestTable[5];

// Starts the modem's worker once; 0 when it runs or was started before.
int32_t init_at_channel(int32_t modem_id);
// The worker: opens the port, then serves requests for its modem.
void cmdloop(AsyncCmdChannel* channel);
// Stops the modem's worker, if one runs, and waits until it has left: the
// port is closed and a later init_at_channel starts a new worker. A request
// in progress is finished first.
void asyncCmdStop(int32_t modem_id);
// Opens a modem's AT port by path for reading and writing (not as the
// controlling terminal); a descriptor or -1. Its own unit, so that tests can
// watch the worker's open attempts.
int asyncCmdOpenPort(const char* path);
// Puts an opened port that is a terminal (a USB modem's tty) in raw mode and
// logs it: 1 when done, 0 for a port that is no terminal (left as it is),
// -1 when the settings could not be changed (logged; the port stays open).
int asyncCmdRawTerminal(int fd, const char* path);
// How long the command in flight on either modem has waited without a line
// of its answer, in microseconds; 0 when none waits.
int64_t asyncCmdSilenceMicros(void);
// Runs the handler of g_asyncCmd.request on the worker thread.
void processRequest(void);
// Posts one request to the modem's worker and waits for it to finish.
// 0 once the result is in g_asyncCmd, -1 when refused before posting.
int32_t asyncCmdPush(int32_t modem_id, int32_t request, const uint8_t* data, int32_t datalen);

// Upper-case hex of `count` bytes into `out` (terminated). Returns the number
// of characters written, or -1 when the text and its NUL do not fit outSize.
int32_t hexEncode(const uint8_t* bytes, int32_t count, char* out, size_t outSize);
// Bytes of the first `n` characters of `text`: n / 2, or -1 for absent text,
// an odd or negative n, a non-hex character (bytes before it stay written),
// or a result that would not fit outSize (then nothing is written).
int32_t hexDecode(const char* text, int32_t n, uint8_t* out, size_t outSize);

// Request handlers, reached through processRequest on the worker thread.
void request_get_card_present(void);
void request_get_atr(void);
void request_open_logical_channel(void);
void request_close_logical_channel(void);
void request_transmit_apdu(void);

// Logical channel -> modem session id, one table per modem; entry 0 unused.
#define SESSION_TABLE_SIZE 20
extern int32_t sessionTable[ASYNC_CMD_MODEM_MAX][SESSION_TABLE_SIZE];
extern int32_t* curSessionTable;
// Points curSessionTable at the table of the calling worker's modem.
void adjust_session(void);
// Forgets every session recorded for the modem.
void clear_session_table(int32_t modem_id);

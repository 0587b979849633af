#include "async_cmd.h"
#include "session_release.h"

#include <errno.h>
#include <fcntl.h>
#include <securec.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <ctime>

#include "qv_log.h"
#include "se_delay.h"

AsyncCmdRecord g_asyncCmd;

AsyncCmdChannel g_asyncCmdChannel[ASYNC_CMD_MODEM_MAX] = {
    {0, 0, nullptr, pthread_t(), PTHREAD_MUTEX_INITIALIZER, PTHREAD_COND_INITIALIZER,
     PTHREAD_COND_INITIALIZER, nullptr, nullptr, nullptr},
    {1, 0, nullptr, pthread_t(), PTHREAD_MUTEX_INITIALIZER, PTHREAD_COND_INITIALIZER,
     PTHREAD_COND_INITIALIZER, nullptr, nullptr, nullptr},
};

std::atomic<int32_t> atPortOpened[ASYNC_CMD_MODEM_MAX];
std::atomic<int32_t> asyncCmdInited[ASYNC_CMD_MODEM_MAX];

const RequestTableEntry requestTable[5] = {
    {REQUEST_GET_CARD_PRESENT, request_get_card_present},
    {REQUEST_GET_ATR, request_get_atr},
    {REQUEST_OPEN_LOGICAL_CHANNEL, request_open_logical_channel},
    {REQUEST_TRANSMIT_APDU, request_transmit_apdu},
    {REQUEST_CLOSE_LOGICAL_CHANNEL, request_close_logical_channel},
};

namespace {

pthread_attr_t asyncCmdAttr[ASYNC_CMD_MODEM_MAX];

// init runs without the front's lock and may come from two RPC threads at
// once: the check and the start of a worker must be one step, or a modem
// could get two workers fighting over its port.
pthread_mutex_t g_initLock = PTHREAD_MUTEX_INITIALIZER;

class InitLock {
 public:
  InitLock() { pthread_mutex_lock(&g_initLock); }
  ~InitLock() { pthread_mutex_unlock(&g_initLock); }
  InitLock(const InitLock&) = delete;
  InitLock& operator=(const InitLock&) = delete;
};

class ChannelLock {
 public:
  explicit ChannelLock(AsyncCmdChannel& ch) : m_(&ch.mutex) { pthread_mutex_lock(m_); }
  ~ChannelLock() { pthread_mutex_unlock(m_); }
  ChannelLock(const ChannelLock&) = delete;
  ChannelLock& operator=(const ChannelLock&) = delete;

 private:
  pthread_mutex_t* m_;
};

const char* const kDevPath[ASYNC_CMD_MODEM_MAX] = {MODEM0_AT_DEV_PATH, MODEM1_AT_DEV_PATH};

constexpr int kOpenTryCount = 5;
constexpr uint64_t kOpenRetryMicros = 1000000;
constexpr uint64_t kWorkerStartMicros = 20000;
// How often an idle worker looks whether its port is still there.
constexpr uint64_t kPortCheckMicros = 1000000;

// Workers of each modem that have not yet left their record; guarded by the
// modem's mutex, signalled on g_workerGone when one leaves.
int32_t g_workers[ASYNC_CMD_MODEM_MAX];
pthread_cond_t g_workerGone = PTHREAD_COND_INITIALIZER;

// Whether a started worker's first try at its port has ended (opened, or
// failed once); guarded by the modem's mutex, signalled on g_firstTry. init
// waits for it, so that a state reported ready is not followed by calls
// refused only because the worker had not been scheduled yet.
int32_t g_firstTryDone[ASYNC_CMD_MODEM_MAX];
pthread_cond_t g_firstTry;
constexpr uint64_t kFirstTryMicros = 1000000;

// The workers' timed waits run on the monotonic clock, so that a change of
// the wall clock neither stretches nor cuts a retry pause.
bool monotonicRequestConds() {
  pthread_condattr_t attr;
  pthread_condattr_init(&attr);
  pthread_condattr_setclock(&attr, CLOCK_MONOTONIC);
  for (AsyncCmdChannel& ch : g_asyncCmdChannel) {
    pthread_cond_destroy(&ch.req_cond);
    pthread_cond_init(&ch.req_cond, &attr);
  }
  pthread_cond_init(&g_firstTry, &attr);
  pthread_condattr_destroy(&attr);
  return true;
}
[[maybe_unused]] const bool g_condsReady = monotonicRequestConds();

void* cmdloopEntry(void* arg) {
  cmdloop(static_cast<AsyncCmdChannel*>(arg));
  return nullptr;
}

bool validModem(int32_t modem_id) { return modem_id == 0 || modem_id == 1; }

int openPort(const char* path) { return asyncCmdOpenPort(path); }

int hexNibble(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return -1;
}

bool requestFor(int32_t id) {
  return g_asyncCmd.state == CMD_STATE_REQUEST && g_asyncCmd.modem_id == id;
}

// The monotonic time `micros` (scaled by the delay seam) from now.
struct timespec deadlineIn(uint64_t micros) {
  uint64_t us = se_delay::scaledMicros(micros);
  struct timespec t;
  clock_gettime(CLOCK_MONOTONIC, &t);
  uint64_t nsec = static_cast<uint64_t>(t.tv_nsec) + (us % 1000000ULL) * 1000ULL;
  t.tv_sec += static_cast<time_t>(us / 1000000ULL + nsec / 1000000000ULL);
  t.tv_nsec = static_cast<long>(nsec % 1000000000ULL);
  return t;
}

// Waits on the worker's condition (channel mutex held) until a wake-up or
// `deadline`; true when the deadline has passed.
bool waitOnChannel(AsyncCmdChannel* ch, const struct timespec& deadline) {
  return pthread_cond_timedwait(&ch->req_cond, &ch->mutex, &deadline) == ETIMEDOUT;
}

void firstTryEnded(AsyncCmdChannel* ch, int32_t id, bool opened) {
  ChannelLock lock(*ch);
  if (opened) atPortOpened[id] = 1;
  g_firstTryDone[id] = 1;
  pthread_cond_broadcast(&g_firstTry);
}

bool running(AsyncCmdChannel* ch) {
  ChannelLock lock(*ch);
  return ch->running != 0;
}

// Pauses one open retry; only a stop cuts it short. False once stopped.
bool pauseBeforeRetry(AsyncCmdChannel* ch) {
  const struct timespec end = deadlineIn(kOpenRetryMicros);
  ChannelLock lock(*ch);
  while (ch->running != 0) {
    if (waitOnChannel(ch, end)) return ch->running != 0;
  }
  return false;
}

// The start: the port is opened up to six times, one second apart.
// Returns the descriptor, or -1 after the sixth failure or a stop.
int openAtStart(AsyncCmdChannel* ch, int32_t id) {
  int openTryCount = kOpenTryCount;
  int fd = openPort(ch->dev_path);
  QV_LOGI("%s[%d] open[%s] fd: %d, openTryCount: %d", "cmdloop", id, ch->dev_path, fd,
          openTryCount);
  if (fd < 1) firstTryEnded(ch, id, false);
  // A descriptor 0 counts as failed too: the port never takes stdin's place.
  while (fd < 1) {
    if (fd >= 0) close(fd);
    if (openTryCount == 0) {
      QV_LOGE("%s[%d] Wait AT port timeout, fail", "cmdloop", id);
      return -1;
    }
    openTryCount--;
    if (!pauseBeforeRetry(ch)) return -1;
    fd = openPort(ch->dev_path);
    QV_LOGI("%s[%d] open[%s] fd: %d, openTryCount: %d", "cmdloop", id, ch->dev_path, fd,
            openTryCount);
  }
  return fd;
}

// A port that is away (not there at the start, or lost since) is tried
// once a second, and at once when a caller or an init asks for the modem,
// until it opens or the worker is stopped (-1). Quiet while it fails.
int waitForPort(AsyncCmdChannel* ch, int32_t id) {
  for (;;) {
    {
      ChannelLock lock(*ch);
      if (ch->running == 0) return -1;
      (void)waitOnChannel(ch, deadlineIn(kOpenRetryMicros));
      if (ch->running == 0) return -1;
    }
    int fd = openPort(ch->dev_path);
    if (fd >= 1) {
      QV_LOGI("%s[%d] open[%s] fd: %d, AT port back", "cmdloop", id, ch->dev_path, fd);
      return fd;
    }
    if (fd >= 0) close(fd);
  }
}

// Serves requests until the worker is stopped (false) or its port is lost
// (true). A request posted before the loss is still run: its AT commands
// fail at once on the closed port and the caller gets the usual failure.
bool serve(AsyncCmdChannel* ch, int32_t id, bool watchPort) {
  ChannelLock lock(*ch);
  for (;;) {
    while (ch->running != 0 && !requestFor(id)) {
      if (watchPort && at_is_closed() != 0) {
        // Under the mutex: no push can post for this modem from here on.
        atPortOpened[id] = 0;
        return true;
      }
      // Sessions a release missed are released once the modem answers
      // again, whether or not a request comes.
      if (session_release_count(id) > 0) session_release_pending(id);
      (void)waitOnChannel(ch, deadlineIn(kPortCheckMicros));
    }
    if (ch->running == 0) return false;
    QV_LOGD("%s, deal command=%d,%d", "cmdloop", g_asyncCmd.request, id);
    // Owed releases go first: a new open must not meet a session the
    // modem still holds for a channel that was given up.
    session_release_pending(id);
    ch->handler();
    g_asyncCmd.modem_id = id;
    g_asyncCmd.state = CMD_STATE_RESPONSE;
    // The caller's condition is set under the lock; it is woken once the
    // lock is free, so it does not wake only to wait for this thread.
    pthread_mutex_unlock(&ch->mutex);
    pthread_cond_signal(&ch->resp_cond);
    pthread_mutex_lock(&ch->mutex);
  }
}

// The worker has left: a later init_at_channel may start another.
void workerEnded(AsyncCmdChannel* ch, int32_t id) {
  atPortOpened[id] = 0;
  {
    InitLock lock;
    free(ch->dev_path);
    ch->dev_path = nullptr;
    ch->thread = pthread_t();
    pthread_attr_destroy(&asyncCmdAttr[id]);
    asyncCmdInited[id] = 0;
  }
  ChannelLock lock(*ch);
  g_workers[id]--;
  pthread_cond_broadcast(&g_workerGone);
}

// Wakes the worker of a started modem, so that a worker waiting for its
// port tries it now.
void pokeWorker(int32_t modem_id) {
  AsyncCmdChannel& ch = g_asyncCmdChannel[modem_id];
  ChannelLock lock(ch);
  pthread_cond_broadcast(&ch.req_cond);
}

}  // namespace

int32_t init_at_channel(int32_t modem_id) {
  if (!validModem(modem_id)) return -1;
  InitLock lock;
  if (asyncCmdInited[modem_id] == 1) {
    if (atPortOpened[modem_id] != 1) pokeWorker(modem_id);
    return 0;
  }
  const char* path = kDevPath[modem_id];
  QV_LOGI("%s, devpath: %s", "asyncCmdInit", path);

  pthread_attr_init(&asyncCmdAttr[modem_id]);
  pthread_attr_setdetachstate(&asyncCmdAttr[modem_id], PTHREAD_CREATE_DETACHED);

  AsyncCmdChannel& ch = g_asyncCmdChannel[modem_id];
  {
    ChannelLock chLock(ch);
    ch.modem_id = modem_id;
    ch.running = 1;
    g_workers[modem_id]++;
    g_firstTryDone[modem_id] = 0;
  }
  ch.unsol_handler = nullptr;
  ch.timeout_handler = nullptr;
  ch.handler = processRequest;
  free(ch.dev_path);
  ch.dev_path = strdup(path);

  if (pthread_create(&ch.thread, &asyncCmdAttr[modem_id], cmdloopEntry, &ch) != 0) {
    QV_LOGE("%s: pthread_create failed", "asyncCmdInit");
    QV_LOGE("%s, modem_id: %d asyncCmdInit failed", "init_at_channel", modem_id);
    pthread_attr_destroy(&asyncCmdAttr[modem_id]);
    free(ch.dev_path);
    ch.dev_path = nullptr;
    ChannelLock chLock(ch);
    ch.running = 0;
    g_workers[modem_id]--;
    return -1;
  }
  se_delay::sleepMicros(kWorkerStartMicros);
  {
    const struct timespec end = deadlineIn(kFirstTryMicros);
    ChannelLock chLock(ch);
    while (g_firstTryDone[modem_id] == 0) {
      if (pthread_cond_timedwait(&g_firstTry, &ch.mutex, &end) == ETIMEDOUT) break;
    }
  }
  asyncCmdInited[modem_id] = 1;
  return 0;
}

void asyncCmdStop(int32_t modem_id) {
  if (!validModem(modem_id)) return;
  AsyncCmdChannel& ch = g_asyncCmdChannel[modem_id];
  ChannelLock lock(ch);
  ch.running = 0;
  pthread_cond_broadcast(&ch.req_cond);
  while (g_workers[modem_id] > 0) pthread_cond_wait(&g_workerGone, &ch.mutex);
}

int64_t asyncCmdSilenceMicros(void) {
  int64_t a = at_silence_micros(0);
  int64_t b = at_silence_micros(1);
  return a > b ? a : b;
}

void cmdloop(AsyncCmdChannel* channel) {
  if (channel == nullptr) return;
  const int32_t id = channel->modem_id;
  if (!validModem(id)) {
    QV_LOGE("%s, channel %d cannot open", "cmdloop", id);
    return;
  }
  atPortOpened[id] = 0;
  QV_LOGI("%s[%d] > Start...", "cmdloop", id);

  const bool havePath = channel->dev_path != nullptr && channel->dev_path[0] != '\0';
  int fd = -1;
  if (havePath) {
    fd = openAtStart(channel, id);
    if (fd < 1 && running(channel)) {
      // A modem that comes up late is still served once its port appears.
      QV_LOGE("%s[%d] still waiting for the AT port", "cmdloop", id);
      fd = waitForPort(channel, id);
    }
    if (fd < 1) {
      workerEnded(channel, id);
      return;
    }
  }

  for (;;) {
    const bool opened = at_open(fd, channel->unsol_handler, id) == 0;
    firstTryEnded(channel, id, opened);
    if (!opened) {
      QV_LOGE("%s, at_open fail", "cmdloop");
      break;
    }
    at_set_on_timeout(channel->timeout_handler);
    if (!serve(channel, id, havePath)) break;

    QV_LOGE("%s[%d] AT port lost, channels closed; reopening", "cmdloop", id);
    at_close();
    // The channels of a lost port are gone for the clients. The modem may
    // still hold their sessions (a USB modem keeps them when only its
    // port went away): they are released once the port is back.
    session_release_all(id);
    fd = waitForPort(channel, id);
    if (fd < 1) break;
  }

  QV_LOGI("%s[%d] < Stop", "cmdloop", id);
  at_close();
  workerEnded(channel, id);
}

void processRequest(void) {
  if (g_asyncCmd.state == CMD_STATE_REQUEST) {
    for (const RequestTableEntry& row : requestTable) {
      if (row.request == g_asyncCmd.request) {
        row.handler();
        return;
      }
    }
  }
  QV_LOGE("%s, request %d not support", "processRequest", g_asyncCmd.request);
}

int32_t asyncCmdPush(int32_t modem_id, int32_t request, const uint8_t* data, int32_t datalen) {
  if (!validModem(modem_id)) {
    QV_LOGE("%s, index: %d is invalid", "asyncCmdPush", modem_id);
    return -1;
  }
  if (atPortOpened[modem_id] != 1) {
    QV_LOGE("%s, atPortOpened[%d] not open", "asyncCmdPush", modem_id);
    if (asyncCmdInited[modem_id] == 1) pokeWorker(modem_id);
    return -1;
  }
  if (request < 1 || request > 6) {
    QV_LOGE("%s, request: %d is invalid", "asyncCmdPush", request);
    return -1;
  }
  if (datalen < 0 || datalen > ASYNC_CMD_DATA_MAX) {
    QV_LOGE("%s, datalen: %d is invalid", "asyncCmdPush", datalen);
    return -1;
  }
  if (data == nullptr && datalen != 0) {
    QV_LOGE("%s, data is NULL", "asyncCmdPush");
    return -1;
  }

  AsyncCmdChannel& ch = g_asyncCmdChannel[modem_id];
  pthread_mutex_lock(&ch.mutex);
  if (atPortOpened[modem_id] != 1) {
    // Lost since the check above: the worker no longer takes requests.
    pthread_mutex_unlock(&ch.mutex);
    QV_LOGE("%s, atPortOpened[%d] not open", "asyncCmdPush", modem_id);
    return -1;
  }
  g_asyncCmd.modem_id = modem_id;
  g_asyncCmd.request = request;
  g_asyncCmd.datalen = datalen;
  if (datalen > 0) {
    (void)memset_s(g_asyncCmd.data, sizeof(g_asyncCmd.data), 0, sizeof(g_asyncCmd.data));
    (void)memcpy_s(g_asyncCmd.data, sizeof(g_asyncCmd.data), data, static_cast<size_t>(datalen));
  }
  g_asyncCmd.state = CMD_STATE_REQUEST;
  // Posted under the lock, signalled once it is free: the worker takes the
  // lock without waiting for this thread to sleep. Only one caller posts at
  // a time (the front's lock), so the record stays as it is meanwhile.
  pthread_mutex_unlock(&ch.mutex);
  pthread_cond_broadcast(&ch.req_cond);
  pthread_mutex_lock(&ch.mutex);
  while (!(g_asyncCmd.state == CMD_STATE_RESPONSE && g_asyncCmd.modem_id == modem_id)) {
    pthread_cond_wait(&ch.resp_cond, &ch.mutex);
  }
  pthread_mutex_unlock(&ch.mutex);
  QV_LOGD("%s, resp finish", "asyncCmdPush");
  return 0;
}

int32_t hexEncode(const uint8_t* bytes, int32_t count, char* out, size_t outSize) {
  static const char kDigits[] = "0123456789ABCDEF";
  if (out == nullptr || count < 0 || (count > 0 && bytes == nullptr)) return -1;
  size_t needed = static_cast<size_t>(count) * 2 + 1;
  if (needed > outSize) return -1;
  for (int32_t i = 0; i < count; i++) {
    out[2 * i] = kDigits[bytes[i] >> 4];
    out[2 * i + 1] = kDigits[bytes[i] & 0x0F];
  }
  out[2 * count] = '\0';
  return count * 2;
}

int32_t hexDecode(const char* text, int32_t n, uint8_t* out, size_t outSize) {
  if (text == nullptr || n < 0 || (n % 2) != 0) return -1;
  int32_t count = n / 2;
  if (static_cast<size_t>(count) > outSize || (count > 0 && out == nullptr)) return -1;
  for (int32_t i = 0; i < count; i++) {
    int hi = hexNibble(text[2 * i]);
    int lo = hi < 0 ? -1 : hexNibble(text[2 * i + 1]);
    if (hi < 0 || lo < 0) return -1;
    out[i] = static_cast<uint8_t>((hi << 4) | lo);
  }
  return count;
}

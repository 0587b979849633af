#include "async_cmd.h"

#include <fcntl.h>
#include <securec.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>

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

const char* const kDevPath[ASYNC_CMD_MODEM_MAX] = {MODEM0_AT_DEV_PATH, MODEM1_AT_DEV_PATH};

constexpr int kOpenTryCount = 5;
constexpr uint64_t kOpenRetryMicros = 1000000;
constexpr uint64_t kWorkerStartMicros = 20000;

void* cmdloopEntry(void* arg) {
  cmdloop(static_cast<AsyncCmdChannel*>(arg));
  return nullptr;
}

bool validModem(int32_t modem_id) { return modem_id == 0 || modem_id == 1; }

int openPort(const char* path) { return open(path, O_RDWR | O_NOCTTY); }

int hexNibble(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return -1;
}

}  // namespace

int32_t init_at_channel(int32_t modem_id) {
  if (!validModem(modem_id)) return -1;
  InitLock lock;
  if (asyncCmdInited[modem_id] == 1) return 0;
  const char* path = kDevPath[modem_id];
  QV_LOGI("%s, devpath: %s", "asyncCmdInit", path);

  pthread_attr_init(&asyncCmdAttr[modem_id]);
  pthread_attr_setdetachstate(&asyncCmdAttr[modem_id], PTHREAD_CREATE_DETACHED);

  AsyncCmdChannel& ch = g_asyncCmdChannel[modem_id];
  ch.modem_id = modem_id;
  ch.running = 1;
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
    return -1;
  }
  se_delay::sleepMicros(kWorkerStartMicros);
  asyncCmdInited[modem_id] = 1;
  return 0;
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

  int fd = -1;
  if (channel->dev_path != nullptr && channel->dev_path[0] != '\0') {
    int openTryCount = kOpenTryCount;
    fd = openPort(channel->dev_path);
    QV_LOGI("%s[%d] open[%s] fd: %d, openTryCount: %d", "cmdloop", id, channel->dev_path, fd,
            openTryCount);
    // A descriptor 0 counts as failed too: the port never takes stdin's place.
    while (fd < 1) {
      if (openTryCount == 0) {
        QV_LOGE("%s[%d] Wait AT port timeout, fail", "cmdloop", id);
        if (fd >= 0) close(fd);
        return;
      }
      openTryCount--;
      se_delay::sleepMicros(kOpenRetryMicros);
      fd = openPort(channel->dev_path);
      QV_LOGI("%s[%d] open[%s] fd: %d, openTryCount: %d", "cmdloop", id, channel->dev_path, fd,
              openTryCount);
    }
  }

  if (at_open(fd, channel->unsol_handler, id) != 0) {
    QV_LOGE("%s, at_open fail", "cmdloop");
    return;
  }
  atPortOpened[id] = 1;
  at_set_on_timeout(channel->timeout_handler);

  while (channel->running != 0) {
    pthread_mutex_lock(&channel->mutex);
    while (!(g_asyncCmd.state == CMD_STATE_REQUEST && g_asyncCmd.modem_id == id)) {
      pthread_cond_wait(&channel->req_cond, &channel->mutex);
    }
    QV_LOGD("%s, deal command=%d,%d", "cmdloop", g_asyncCmd.request, id);
    channel->handler();
    g_asyncCmd.modem_id = id;
    g_asyncCmd.state = CMD_STATE_RESPONSE;
    pthread_cond_signal(&channel->resp_cond);
    pthread_mutex_unlock(&channel->mutex);
  }

  QV_LOGI("%s[%d] < Stop", "cmdloop", id);
  at_close();
  free(channel->dev_path);
  channel->dev_path = nullptr;
  channel->thread = pthread_t();
  pthread_attr_destroy(&asyncCmdAttr[id]);
  atPortOpened[id] = 0;
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
  g_asyncCmd.modem_id = modem_id;
  g_asyncCmd.request = request;
  g_asyncCmd.datalen = datalen;
  if (datalen > 0) {
    (void)memset_s(g_asyncCmd.data, sizeof(g_asyncCmd.data), 0, sizeof(g_asyncCmd.data));
    (void)memcpy_s(g_asyncCmd.data, sizeof(g_asyncCmd.data), data, static_cast<size_t>(datalen));
  }
  g_asyncCmd.state = CMD_STATE_REQUEST;
  pthread_cond_broadcast(&ch.req_cond);
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

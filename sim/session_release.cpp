#include "session_release.h"

#include <securec.h>

#include <algorithm>
#include <mutex>
#include <vector>

#include <atchannel.h>

#include "async_cmd.h"
#include "qv_log.h"

namespace {

constexpr size_t kCloseCmdSize = 32;

std::mutex g_pendingLock;  // guards g_pending
std::vector<int32_t> g_pending[ASYNC_CMD_MODEM_MAX];

bool validModem(int32_t modem) { return modem >= 0 && modem < ASYNC_CMD_MODEM_MAX; }

}  // namespace

int32_t session_release_now(const char* fn, int32_t session) {
  char cmd[kCloseCmdSize];
  (void)memset_s(cmd, sizeof(cmd), 0, sizeof(cmd));
  if (snprintf_s(cmd, sizeof(cmd), sizeof(cmd) - 1, "AT+CCHC=%d", session) < 1) return 0;
  ATResponse* response = nullptr;
  const int32_t err = at_send_command(cmd, &response);
  int32_t result = -1;
  if (err >= 0 && response != nullptr) result = response->success != 0 ? 1 : 0;
  at_response_free(response);
  if (result == 1) {
    QV_LOGI("%s, released modem session %d", fn, session);
  } else {
    QV_LOGE("%s, release of modem session %d failed%s", fn, session,
            result < 0 ? ": no answer, kept for later" : "");
  }
  return result;
}

void session_release_later(int32_t modem, int32_t session) {
  if (!validModem(modem) || session < 1) return;
  std::lock_guard<std::mutex> g(g_pendingLock);
  std::vector<int32_t>& list = g_pending[modem];
  if (std::find(list.begin(), list.end(), session) == list.end()) list.push_back(session);
}

void session_release_all(int32_t modem) {
  if (!validModem(modem)) return;
  for (int32_t& session : sessionTable[modem]) {
    session_release_later(modem, session);
    session = 0;
  }
}

void session_release_pending(int32_t modem) {
  if (!validModem(modem)) return;
  std::vector<int32_t> todo;
  {
    std::lock_guard<std::mutex> g(g_pendingLock);
    todo = g_pending[modem];
  }
  for (int32_t session : todo) {
    // The modem stopped answering: the rest wait for the next request.
    if (session_release_now("session_release_pending", session) < 0) return;
    std::lock_guard<std::mutex> g(g_pendingLock);
    std::vector<int32_t>& list = g_pending[modem];
    list.erase(std::remove(list.begin(), list.end(), session), list.end());
  }
}

void session_release_forget(int32_t modem) {
  if (!validModem(modem)) return;
  std::lock_guard<std::mutex> g(g_pendingLock);
  g_pending[modem].clear();
}

int32_t session_release_count(int32_t modem) {
  if (!validModem(modem)) return 0;
  std::lock_guard<std::mutex> g(g_pendingLock);
  return static_cast<int32_t>(g_pending[modem].size());
}

#pragma once
// The test-only resets of the SIM side's process-wide state, one per
// subsystem. The product never calls them.
#include <cstdint>

#include "ZerbSimSecureElement.h"
#include "async_cmd.h"

namespace sim_test {

// The request engine: both workers stopped (their ports closed), the
// request record, the session tables and the per-modem flags as at start.
inline void resetEngine() {
  asyncCmdStop(0);
  asyncCmdStop(1);
  g_asyncCmd.modem_id = 0;
  g_asyncCmd.state = CMD_STATE_IDLE;
  g_asyncCmd.request = 0;
  g_asyncCmd.param = 0;
  g_asyncCmd.datalen = 0;
  for (uint8_t& b : g_asyncCmd.data) b = 0;
  clear_session_table(0);
  clear_session_table(1);
  curSessionTable = sessionTable[0];
  for (int m = 0; m < ASYNC_CMD_MODEM_MAX; m++) {
    atPortOpened[m] = 0;
    asyncCmdInited[m] = 0;
  }
}

// The SIM front: the engine as above, no channel flagged, the settling
// delay not yet passed.
inline void resetFront() {
  resetEngine();
  for (uint8_t& flag : g_simOpenedChannels) flag = 0;
  timeflag = -1;
}

}  // namespace sim_test

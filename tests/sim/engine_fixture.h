#pragma once
// Shared set-up of the engine and front tests: a temporary device root, a
// scripted modem per AT port (a pty linked at dev/appvcomNN), and resets of
// the SIM side's process-wide state, which the product never resets.
#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "../atchannel/scripted_modem.h"
#include "ZerbSimSecureElement.h"
#include "async_cmd.h"
#include "port_open_seam.h"
#include "se_delay.h"
#include "se_device_gate.h"
#include "session_release.h"
#include "test_root.h"

namespace sim_test {

using FakeModem = at_test::ScriptedModem;

inline std::string okLine(const std::string& line) { return "\r\n" + line + "\r\n\r\nOK\r\n"; }
inline std::string finalLine(const std::string& text) { return "\r\n" + text + "\r\n"; }

// First matching command prefix wins; anything else is answered "ERROR".
using Replies = std::vector<std::pair<std::string, std::string>>;
inline FakeModem::Script scriptOf(Replies replies) {
  return [replies](FakeModem& modem, const std::string& command) {
    for (const auto& r : replies) {
      if (command.compare(0, r.first.size(), r.first) == 0) return modem.send(r.second);
    }
    modem.send(finalLine("ERROR"));
  };
}

inline std::unique_ptr<FakeModem> modemAt(const std::string& linkPath, bool linkNow = true) {
  std::unique_ptr<FakeModem> m = FakeModem::pty(linkPath, linkNow);
  if (m) m->setScript(scriptOf({}));
  return m;
}

template <typename Pred>
bool waitUntil(Pred pred) {
  return at_test::eventually(pred);
}

inline std::string hexOf(const std::vector<uint8_t>& bytes) {
  static const char* d = "0123456789ABCDEF";
  std::string s;
  for (uint8_t b : bytes) s += std::string{d[b >> 4], d[b & 15]};
  return s;
}

// Both workers stopped (ports closed), request record, session tables,
// channel flags and settling as at start.
inline void resetSim() {
  asyncCmdStop(0);
  asyncCmdStop(1);
  g_asyncCmd.modem_id = 0;
  g_asyncCmd.state = CMD_STATE_IDLE;
  g_asyncCmd.request = g_asyncCmd.param = g_asyncCmd.datalen = 0;
  for (uint8_t& b : g_asyncCmd.data) b = 0;
  clear_session_table(0);
  clear_session_table(1);
  curSessionTable = sessionTable[0];
  for (int m = 0; m < ASYNC_CMD_MODEM_MAX; m++) atPortOpened[m] = asyncCmdInited[m] = 0;
  for (auto& flag : g_simOpenedChannels) flag = 0;
  for (int m = 0; m < ASYNC_CMD_MODEM_MAX; m++) session_release_forget(m);
  ::android::hardware::secure_element::V1_0::implementation::ZerbSimSecureElement::gate().forgetChannels();
  timeflag = -1;
}

class EngineTest : public ::testing::Test {
 protected:
  void SetUp() override {
    resetSim();
    se_delay::setDivisorForTest(100);
    modem0_ = modemAt(root_.at("dev/appvcom18"));
    ASSERT_TRUE(modem0_);
  }
  // Workers first: they hold the ports the modems serve.
  void TearDown() override {
    resetSim();
    setBeforeOpen(nullptr);
  }
  void startModem1() {
    modem1_ = modemAt(root_.at("dev/appvcom34"));
    ASSERT_TRUE(modem1_);
  }
  void startWorker(int32_t modem) {
    ASSERT_EQ(0, init_at_channel(modem));
    ASSERT_TRUE(waitUntil([&] { return atPortOpened[modem] == 1; }));
  }
  // Pushes one request with `param` written first, as the front does.
  int32_t push(int32_t modem, int32_t request, const std::vector<uint8_t>& data, int32_t param = 0) {
    g_asyncCmd.param = param;
    return asyncCmdPush(modem, request, data.empty() ? nullptr : data.data(),
                        static_cast<int32_t>(data.size()));
  }
  std::vector<uint8_t> result(int offset = 0) const {
    if (g_asyncCmd.datalen < 1) return {};
    return std::vector<uint8_t>(g_asyncCmd.data + offset, g_asyncCmd.data + offset + g_asyncCmd.datalen);
  }

  TestRoot root_;
  std::unique_ptr<FakeModem> modem0_;
  std::unique_ptr<FakeModem> modem1_;
};

}  // namespace sim_test

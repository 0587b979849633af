#pragma once
// Shared set-up of the engine and front tests: a temporary device root, a
// scripted modem per AT port, and a running worker for modem 0.
#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "async_cmd.h"
#include "fake_modem.h"
#include "port_open_seam.h"
#include "se_delay.h"
#include "sim_test_reset.h"
#include "test_root.h"

namespace sim_test {

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

inline std::string hexOf(const std::vector<uint8_t>& bytes) {
  static const char* d = "0123456789ABCDEF";
  std::string s;
  for (uint8_t b : bytes) {
    s += d[b >> 4];
    s += d[b & 15];
  }
  return s;
}

class EngineTest : public ::testing::Test {
 protected:
  void SetUp() override {
    resetEngine();
    se_delay::setDivisorForTest(100);
    modem0_ = modemAt(root_.at("dev/appvcom18"));
    ASSERT_TRUE(modem0_);
  }
  // Workers first: they hold the ports the modems serve.
  void TearDown() override {
    resetEngine();
    setBeforeOpen(nullptr);
  }
  void startModem1() {
    modem1_ = modemAt(root_.at("dev/appvcom34"));
    ASSERT_TRUE(modem1_);
  }
  // Starts the modem's worker and waits for its port to be open.
  void startWorker(int32_t modem) {
    ASSERT_EQ(0, init_at_channel(modem));
    ASSERT_TRUE(waitUntil([&] { return atPortOpened[modem] == 1; }));
  }
  // Pushes one request with `param` written first, as the front does.
  int32_t push(int32_t modem, int32_t request, const std::vector<uint8_t>& data,
               int32_t param = 0) {
    g_asyncCmd.param = param;
    return asyncCmdPush(modem, request, data.empty() ? nullptr : data.data(),
                        static_cast<int32_t>(data.size()));
  }
  std::vector<uint8_t> result(int offset = 0) const {
    if (g_asyncCmd.datalen < 1) return {};
    return std::vector<uint8_t>(g_asyncCmd.data + offset,
                                g_asyncCmd.data + offset + g_asyncCmd.datalen);
  }

  TestRoot root_;
  std::unique_ptr<FakeModem> modem0_;
  std::unique_ptr<FakeModem> modem1_;
};

}  // namespace sim_test

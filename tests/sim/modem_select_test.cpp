// Modem and slot selection over a temporary device root: the sysfs nodes and
// the properties file are laid out per case and read afresh on every call.
#include <gtest/gtest.h>
#include <host/log_capture.h>
#include <log/log.h>

#include <string>
#include <vector>

#include "modem_select.h"
#include "test_root.h"

namespace {

using android::host::LogCapture;

constexpr const char* kTag = "QvAtChannel";
const char* const kMissing = nullptr;  // the node or property is left out

struct SelectCase {
  const char* name;
  const char* simSwitch;
  const char* cardNum;
  const char* wiredEseType;
  const char* modemNumber;
  const char* simSlot;
  int32_t expected;
  const char* line;  // a log text that must appear, or nullptr
};

class ModemSelect : public ::testing::Test {
 protected:
  void layout(const SelectCase& c) {
    root_.writeNode("sys/nfc/nfc_sim_switch", c.simSwitch);
    root_.writeNode("sys/nfc/nfc_card_num", c.cardNum);
    root_.writeNode("sys/nfc/nfc_wired_ese_type", c.wiredEseType);
    std::string props;
    if (c.modemNumber) props += std::string("ro.odm.config.modem_number=") + c.modemNumber + "\n";
    if (c.simSlot) props += std::string("persist.odm.radio.sim_slot_cfg=") + c.simSlot + "\n";
    root_.writeFile("properties", props);
  }
  sim_test::TestRoot root_;
};

TEST_F(ModemSelect, DecisionTableAndFallbacks) {
  const SelectCase cases[] = {
      {"all nodes missing", kMissing, kMissing, kMissing, kMissing, kMissing, 0, "judge_nfc_switch error SET SIM1"},
      {"defaults, nodes 0/0/0", "0", "0", "0", kMissing, kMissing, 0, "select_nfc_sim=1"},
      {"empty switch node", "", "3", "0", "2", "0,1", 0, "get param error=-48,3,0\n"},
      {"digit then newline", "2\n", "3\n", "0\n", "2", "0,1", 1, nullptr},
      {"off, sim 1, 0,1", "1", "3", "0", "2", "0,1", 0, nullptr},
      {"off, sim 1, 1,0", "1", "3", "0", "2", "1,0", 1, nullptr},
      {"off, sim 2, 0,1", "2", "3", "1", "2", "0,1", 1, nullptr},
      {"off, sim 2, 1,0", "2", "3", "0", "2", "1,0", 0, nullptr},
      {"card num 2 with wired eSE 0", "2", "2", "0", "2", "0,1", 1, nullptr},
      {"card num 2 with wired eSE 1", "2", "2", "1", "2", "0,1", 0, nullptr},
      {"card num 1 ignores switch", "2", "1", "0", "2", "0,1", 0, nullptr},
      {"velk, sim 1, 2,0,1", "1", "3", "0", "2", "2,0,1", 1, "open through velk"},
      {"velk, sim 2, 2,0,1", "2", "3", "0", "2", "2,0,1", 1, nullptr},
      {"velk, sim 1, 2,1,0", "1", "3", "0", "2", "2,1,0", -1, "else4 error=1,1,2,10"},
      {"slot 0, dual", "0", "0", "0", "2", "0", -1, nullptr},
      {"slot 0, single", "0", "0", "0", "1", "0", 0, nullptr},
      {"single, sim 2", "2", "3", "0", "1", "1,0", 0, nullptr},
      {"modem number 3 is dual", "0", "0", "0", "3", "1,0", 1, nullptr},
      {"modem number 22 is single", "2", "3", "0", "22", "0,1", 0, nullptr},
      {"non-numeric slot", "0", "0", "0", "2", "a,b", -1, nullptr},
  };
  for (const SelectCase& c : cases) {
    SCOPED_TRACE(c.name);
    layout(c);
    LogCapture cap;
    EXPECT_EQ(c.expected, communication_which_modem());
    if (c.line) {
      EXPECT_TRUE(cap.contains(c.line, kTag));
    }
    for (const android::host::LogRecord& r : cap.find("", kTag)) EXPECT_EQ(LOG_ID_RADIO, r.buffer);
  }
}

TEST_F(ModemSelect, InputsAreReadAfreshOnEveryCall) {
  layout({"", "0", "3", "0", "2", "0,1", 0, nullptr});
  EXPECT_EQ(0, communication_which_modem());
  root_.writeNode("sys/nfc/nfc_sim_switch", "2");
  EXPECT_EQ(1, communication_which_modem());
  root_.appendFile("properties", "persist.odm.radio.sim_slot_cfg=1,0\n");
  EXPECT_EQ(0, communication_which_modem());
  root_.appendFile("properties", "ro.odm.config.modem_number=1\n");
  EXPECT_EQ(0, communication_which_modem());
}

TEST_F(ModemSelect, JudgeDualSimDefaultsToOneModem) {
  const std::pair<const char*, int32_t> cases[] = {{kMissing, 1}, {"1", 1}, {"2", 2}, {"3", 2},
                                                   {"4", 1},      {"", 1},  {"23", 1}};
  for (const auto& c : cases) {
    root_.writeFile("properties", c.first ? std::string("ro.odm.config.modem_number=") + c.first + "\n" : "");
    EXPECT_EQ(c.second, judge_dual_sim()) << (c.first ? c.first : "(unset)");
  }
}

TEST_F(ModemSelect, NodeInfoEdges) {
  EXPECT_EQ(-1, getNFCNodeInfo(nullptr));
  root_.writeNode("sys/nfc/nfc_card_num", "9x");
  EXPECT_EQ(9, getNFCNodeInfo("/sys/nfc/nfc_card_num"));
  root_.makeDir("sys/nfc/dir_node");  // opens, but cannot be read
  EXPECT_EQ(-1, getNFCNodeInfo("/sys/nfc/dir_node"));
}

}  // namespace

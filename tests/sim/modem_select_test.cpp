// Modem and slot selection over a temporary device root: the sysfs nodes and
// the properties file are laid out per case and read afresh on every call.
#include <gtest/gtest.h>
#include <host/log_capture.h>
#include <log/log.h>

#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include "modem_select.h"
#include "test_root.h"

namespace {

using android::host::LogCapture;

constexpr const char* kTag = "QvAtChannel";

// A node's content; kMissing leaves the file out.
const char* const kMissing = nullptr;

struct SelectCase {
  const char* name;
  const char* simSwitch;
  const char* cardNum;
  const char* wiredEseType;
  const char* modemNumber;  // nullptr: property unset
  const char* simSlot;      // nullptr: property unset
  int32_t expected;
  std::vector<std::string> lines;  // log texts that must appear
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
  const std::vector<SelectCase> cases = {
      {"all nodes missing, defaults", kMissing, kMissing, kMissing, nullptr, nullptr, 0,
       {"judge_nfc_switch get param error=-1,-1,-1\n", "judge_nfc_switch error SET SIM1",
        "communication_which_modem, select_nfc_sim=-1", "dualcards_prop=2", "sim_slot=0,1",
        "close through velk", "support dual sim", "sim_slot_int=1", "selectmodem=0"}},
      {"defaults, nodes 0/0/0", "0", "0", "0", nullptr, nullptr, 0,
       {"select_nfc_sim=1", "sim_slot_str=01", "selectmodem=0"}},
      {"empty switch node", "", "3", "0", "2", "0,1", 0, {"get param error=-48,3,0\n"}},
      {"newline switch node", "\n", "3", "0", "2", "0,1", 0, {"get param error=-38,3,0\n"}},
      {"digit then newline", "2\n", "3\n", "0\n", "2", "0,1", 1,
       {"select_nfc_sim=2", "selectmodem=1"}},
      {"off, sim 1, 0,1", "1", "3", "0", "2", "0,1", 0, {"selectmodem=0"}},
      {"off, sim 1, 1,0", "1", "3", "0", "2", "1,0", 1, {"sim_slot_int=10", "selectmodem=1"}},
      {"off, sim 2, 0,1", "2", "3", "1", "2", "0,1", 1, {"select_nfc_sim=2", "selectmodem=1"}},
      {"off, sim 2, 1,0", "2", "3", "0", "2", "1,0", 0, {"select_nfc_sim=2", "selectmodem=0"}},
      {"card num 2 with wired eSE 0", "2", "2", "0", "2", "0,1", 1, {"select_nfc_sim=2"}},
      {"card num 2 with wired eSE 1", "2", "2", "1", "2", "0,1", 0, {"select_nfc_sim=1"}},
      {"card num 1 ignores switch", "2", "1", "0", "2", "0,1", 0, {"select_nfc_sim=1"}},
      {"velk, sim 1, 2,0,1", "1", "3", "0", "2", "2,0,1", 1,
       {"open through velk", "sim_slot_str=01", "selectmodem=1"}},
      {"velk, sim 2, 2,0,1", "2", "3", "0", "2", "2,0,1", 1, {"else2 selectmodem=1"}},
      {"velk, sim 2, 2,1,0", "2", "3", "0", "2", "2,1,0", 1, {"selectmodem=1"}},
      {"velk, sim 1, 2,1,0", "1", "3", "0", "2", "2,1,0", -1, {"else4 error=1,1,2,10"}},
      {"slot 0, dual", "0", "0", "0", "2", "0", -1,
       {"sim_slot_str=0", "sim_slot_int=0", "else4 error=1,0,2,0"}},
      {"slot 0, single", "0", "0", "0", "1", "0", 0, {"not support dual sim", "selectmodem=0"}},
      {"single, sim 2", "2", "3", "0", "1", "1,0", 0, {"else3 selectmodem=0"}},
      {"modem number 3 is dual", "0", "0", "0", "3", "1,0", 1, {"support dual sim"}},
      {"modem number 22 is single", "2", "3", "0", "22", "0,1", 0, {"not support dual sim"}},
      {"non-numeric slot", "0", "0", "0", "2", "a,b", -1, {"sim_slot_int=0"}},
  };
  for (const SelectCase& c : cases) {
    SCOPED_TRACE(c.name);
    layout(c);
    LogCapture cap;
    EXPECT_EQ(c.expected, communication_which_modem());
    for (const std::string& line : c.lines) EXPECT_TRUE(cap.contains(line, kTag)) << line;
    // Exactly one result line per call.
    size_t results = cap.find("selectmodem=", kTag).size() + cap.find("else4 error=", kTag).size();
    EXPECT_EQ(1u, results);
  }
}

TEST_F(ModemSelect, LogLinesUseRadioBufferAndPriorities) {
  layout({"", kMissing, "0", "0", "2", "2,1,0", -1, {}});
  LogCapture cap;
  ASSERT_EQ(-1, communication_which_modem());
  std::vector<android::host::LogRecord> open = cap.find("getNFCNodeInfo: open ", kTag);
  ASSERT_EQ(1u, open.size());
  EXPECT_EQ(LOG_ID_RADIO, open[0].buffer);
  EXPECT_EQ(ANDROID_LOG_ERROR, open[0].priority);
  EXPECT_NE(std::string::npos, open[0].text.find("/sys/nfc/nfc_sim_switch fail"));
  auto err = cap.find("else4 error=", kTag);
  ASSERT_EQ(1u, err.size());
  EXPECT_EQ(ANDROID_LOG_ERROR, err[0].priority);
  auto slot = cap.find("sim_slot_int=", kTag);
  ASSERT_EQ(1u, slot.size());
  EXPECT_EQ(ANDROID_LOG_DEBUG, slot[0].priority);
}

TEST_F(ModemSelect, InputsAreReadAfreshOnEveryCall) {
  layout({"", "0", "3", "0", "2", "0,1", 0, {}});
  EXPECT_EQ(0, communication_which_modem());
  root_.writeNode("sys/nfc/nfc_sim_switch", "2");
  EXPECT_EQ(1, communication_which_modem());
  root_.appendFile("properties", "persist.odm.radio.sim_slot_cfg=1,0\n");
  EXPECT_EQ(0, communication_which_modem());
  root_.appendFile("properties", "ro.odm.config.modem_number=1\n");
  EXPECT_EQ(0, communication_which_modem());
  EXPECT_EQ(1, judge_dual_sim());
  root_.appendFile("properties", "ro.odm.config.modem_number=2\n");
  EXPECT_EQ(2, judge_dual_sim());
}

TEST_F(ModemSelect, JudgeDualSimDefaultsToOneModem) {
  struct Case {
    const char* modemNumber;
    int32_t expected;
  };
  const Case cases[] = {{nullptr, 1}, {"1", 1}, {"2", 2}, {"3", 2}, {"4", 1}, {"", 1}, {"23", 1}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.modemNumber ? c.modemNumber : "(unset)");
    root_.writeFile("properties", c.modemNumber
                                      ? std::string("ro.odm.config.modem_number=") +
                                            c.modemNumber + "\n"
                                      : std::string());
    LogCapture cap;
    EXPECT_EQ(c.expected, judge_dual_sim());
    EXPECT_TRUE(cap.contains("judge_dual_sim, dualcards_prop=", kTag));
  }
}

TEST_F(ModemSelect, NodeInfoEdges) {
  LogCapture cap;
  EXPECT_EQ(-1, getNFCNodeInfo(nullptr));
  EXPECT_TRUE(cap.contains("getNFCNodeInfo input param error.\n", kTag));
  root_.writeNode("sys/nfc/nfc_card_num", "9x");
  EXPECT_EQ(9, getNFCNodeInfo("/sys/nfc/nfc_card_num"));
  root_.writeNode("sys/nfc/nfc_card_num", "A");
  EXPECT_EQ('A' - '0', getNFCNodeInfo("/sys/nfc/nfc_card_num"));
  // A directory opens but cannot be read.
  root_.makeDir("sys/nfc/dir_node");
  EXPECT_EQ(-1, getNFCNodeInfo("/sys/nfc/dir_node"));
  EXPECT_TRUE(cap.contains("getNFCNodeInfo: read ", kTag));
}

}  // namespace

// End to end on "SIM1": the real daemon, one or two modem-sim processes and
// secli, all in a fresh device root. A killed client and a lost modem are in
// the integration suite.
#include <gtest/gtest.h>

#include <signal.h>

#include <fstream>
#include <iostream>
#include <iterator>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "se_harness.h"

namespace {

using namespace se_test;

constexpr const char* kEchoAid = "A00000000101";
constexpr const char* kP2Aid = "A00000000103";

std::string fileText(const std::string& path) {
  std::ifstream in(path);
  return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

class SimEndToEnd : public ::testing::Test {
 protected:
  // The modem logs to a file, complete by the time its answer is out.
  void startModem(int modem, std::vector<std::string> extra = {}) {
    extra.insert(extra.end(), {"--log", modemLog(modem)});
    modems_.push_back(se_test::startModem(root_, modem, extra));
  }
  void startDaemon() { daemon_ = se_test::startDaemon(root_); }
  std::string modemLog(int modem) const { return root_.at("modem" + std::to_string(modem) + ".log"); }

  // Runs a secli script on SIM1 over one connection, JSON output.
  std::string script(const std::string& lines) {
    const std::string name = "script" + std::to_string(scripts_++) + ".txt";
    root_.write(name, lines);
    std::string out;
    EXPECT_EQ(0, secli(root_, {"--timeout", "20", "--json", "-i", "SIM1", "-f", root_.at(name)}, &out))
        << out;
    return out;
  }
  void TearDown() override {
    // The daemon first, so that no port is in use when the modems go.
    if (daemon_) {
      daemon_->stop(SIGKILL);
      expectNoSanitizerReport("daemon", daemon_->err().text());
      if (HasFailure()) std::cerr << "daemon output:\n" << daemon_->err().text();
    }
    for (auto& m : modems_) m->stop(SIGTERM);
  }

  TempRoot root_;
  std::vector<std::unique_ptr<Process>> modems_;
  std::unique_ptr<Process> daemon_;
  int scripts_ = 0;
};

TEST_F(SimEndToEnd, OneModemChannelsAndApdus) {
  startModem(0);
  startDaemon();
  std::string out = script(std::string("init\npresent\natr\n") +
                           "open " + kP2Aid + " 0x7F\n" +   // channel 1, SELECT with P2 00
                           "transmit 01 20 00 00 00\n" +      // the P2 applet reports 00
                           "open " + kEchoAid + " 0x00\n" +   // channel 2
                           "transmit 02 01 00 00 02 AB CD\n" +
                           "transmit 00 CA 9F 7F 00\n" +      // basic channel, AT+CSIM
                           "close 1\nclose 2\n" +
                           "transmit 02 01 00 00 01 AA\n" +   // closed: empty answer
                           "basic " + kEchoAid + "\n");
  std::istringstream lines(out);
  std::vector<std::string> l;
  for (std::string s; std::getline(lines, s);) l.push_back(s);
  ASSERT_EQ(12u, l.size()) << out;
  EXPECT_EQ("{\"cmd\":\"init\",\"state\":true}", l[0]);
  EXPECT_EQ("{\"cmd\":\"present\",\"present\":true}", l[1]);
  EXPECT_NE(std::string::npos, l[2].find("\"atr\":\"3B")) << l[2];
  EXPECT_NE(std::string::npos, l[3].find("\"status\":\"SUCCESS\",\"channel\":1")) << l[3];
  EXPECT_NE(std::string::npos, l[4].find("\"response\":\"009000\"")) << l[4];
  EXPECT_NE(std::string::npos, l[5].find("\"status\":\"SUCCESS\",\"channel\":2")) << l[5];
  EXPECT_NE(std::string::npos, l[6].find("\"response\":\"ABCD9000\"")) << l[6];
  EXPECT_NE(std::string::npos, l[7].find("\"response\":\"9F7F")) << l[7];
  EXPECT_NE(std::string::npos, l[8].find("\"status\":\"SUCCESS\"")) << l[8];
  EXPECT_NE(std::string::npos, l[9].find("\"status\":\"SUCCESS\"")) << l[9];
  EXPECT_NE(std::string::npos, l[10].find("\"response\":\"\"")) << l[10];
  EXPECT_NE(std::string::npos, l[11].find("\"status\":\"CHANNEL_NOT_AVAILABLE\"")) << l[11];

  std::string log = fileText(modemLog(0));
  for (const char* sent : {"< AT+CCHO=\"A00000000103\"", "< AT+CGLA=257,22,\"00A4040006A00000000103\"",
                           "< AT+CCHP=\"A00000000101\",0", "< AT+CGLA=257,10,\"0120000000\"",
                           "< AT+CSIM=10,\"00CA9F7F00\"", "< AT+CCHC=257", "< AT+CCHC=258"}) {
    EXPECT_NE(std::string::npos, log.find(sent)) << sent << "\n" << log;
  }
}

TEST_F(SimEndToEnd, TwoModemsFollowTheSwitchAndTheSlotOrder) {
  root_.write("properties", "ro.odm.config.modem_number=2\n");
  for (const char* node : {"nfc_sim_switch", "nfc_card_num", "nfc_wired_ese_type"}) {
    root_.write(std::string("sys/nfc/") + node, "0");
  }
  startModem(0);
  startModem(1, {"--card-absent"});
  startDaemon();
  EXPECT_NE(std::string::npos, script("init\n").find("\"state\":true"));

  // NFC on SIM 1, normal slot order: modem 0, whose card is there.
  EXPECT_NE(std::string::npos, script("present\n").find("\"present\":true"));
  // Switched to SIM 2: modem 1, without a card.
  root_.write("sys/nfc/nfc_sim_switch", "2");
  root_.write("sys/nfc/nfc_card_num", "3");
  EXPECT_NE(std::string::npos, script("present\n").find("\"present\":false"));
  // Slots swapped: SIM 2 is on modem 0 again.
  root_.append("properties", "persist.odm.radio.sim_slot_cfg=1,0\n");
  EXPECT_NE(std::string::npos, script("present\n").find("\"present\":true"));

  EXPECT_EQ(2u, countOf(fileText(modemLog(0)), "< AT^CARDTYPE?"));
  EXPECT_EQ(1u, countOf(fileText(modemLog(1)), "< AT^CARDTYPE?"));
}

}  // namespace

// End to end on "SIM1": the real daemon, a modem-sim process and secli, all
// in a fresh device root; the modem selection is in the front's tests.
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
  // What each line of the answer holds, in order.
  const char* const want[] = {"\"state\":true", "\"present\":true", "\"atr\":\"3B",
                              "\"status\":\"SUCCESS\",\"channel\":1", "\"response\":\"009000\"",
                              "\"status\":\"SUCCESS\",\"channel\":2", "\"response\":\"ABCD9000\"",
                              "\"response\":\"9F7F", "\"status\":\"SUCCESS\"", "\"status\":\"SUCCESS\"",
                              "\"response\":\"\"", "\"status\":\"CHANNEL_NOT_AVAILABLE\""};
  std::istringstream lines(out);
  std::string line;
  for (const char* w : want) {
    ASSERT_TRUE(std::getline(lines, line)) << out;
    EXPECT_NE(std::string::npos, line.find(w)) << line;
  }
  EXPECT_FALSE(std::getline(lines, line)) << out;

  std::string log = fileText(modemLog(0));
  for (const char* sent : {"< AT+CCHO=\"A00000000103\"", "< AT+CGLA=257,22,\"00A4040006A00000000103\"",
                           "< AT+CCHP=\"A00000000101\",0", "< AT+CGLA=257,10,\"0120000000\"",
                           "< AT+CSIM=10,\"00CA9F7F00\"", "< AT+CCHC=257", "< AT+CCHC=258"}) {
    EXPECT_NE(std::string::npos, log.find(sent)) << sent << "\n" << log;
  }
}

}  // namespace

// The secli program against the fake secure element served over the real
// socket by this test process.
#include <gtest/gtest.h>

#include <signal.h>

#include <fstream>

#include "../platform/rpc_test_util.h"
#include "se_harness.h"

namespace {

using namespace fake;
using se_test::Process;

struct Outcome {
  int status = -1;
  std::string out, err;
};

size_t lineCount(const std::string& s) { return std::count(s.begin(), s.end(), '\n'); }

class SecliProcessTest : public ::testing::Test {
 protected:
  void start() { server = std::make_unique<Server>(se, "SIM1", 2); }
  void TearDown() override {
    if (server) server->stop();
  }
  std::vector<std::string> argv(const std::vector<std::string>& args) {
    std::vector<std::string> all = {SECLI_PATH, "--root", root.path()};
    all.insert(all.end(), args.begin(), args.end());
    return all;
  }
  // secli with these arguments, its standard input fed `input` and closed;
  // what it wrote, once it has ended.
  Outcome run(const std::vector<std::string>& args, const std::string& input = "") {
    Process p(argv(args), root.path());
    if (!input.empty()) p.write(input);
    p.closeStdin();
    Outcome o;
    o.status = p.waitExit();
    o.out = p.out().text();
    o.err = p.err().text();
    return o;
  }
  TempRoot root;
  sp<FakeSecureElement> se = new FakeSecureElement();
  std::unique_ptr<Server> server;
};

TEST_F(SecliProcessTest, ScriptOfEveryCommandPrintsOneJsonLineEach) {
  start();
  const std::string script =
      "# every command once\n"
      "init\npresent\natr\n"
      "open A0000001510000 0x0C\n"
      "\n"
      "basic \"a0 02\" 4\n"
      "transmit 80 ca 9F7F 00   # trailing comment\n"
      "close 1\nclose 0x09\nsleep 5\n";
  Outcome o = run({"--json", "-i", "SIM1", "-f", "-"}, script);
  EXPECT_EQ(o.status, 0) << o.err;
  EXPECT_EQ(o.err, "");
  EXPECT_EQ(o.out,
            "{\"cmd\":\"init\",\"state\":true}\n"
            "{\"cmd\":\"present\",\"present\":true}\n"
            "{\"cmd\":\"atr\",\"atr\":\"3B8F8001804F0CA0000003060300016A\"}\n"
            "{\"cmd\":\"open\",\"status\":\"SUCCESS\",\"channel\":1,"
            "\"select\":\"6F0AA00000015100009000\"}\n"
            "{\"cmd\":\"basic\",\"status\":\"SUCCESS\",\"select\":\"A002049000\"}\n"
            "{\"cmd\":\"transmit\",\"response\":\"80CA9F7F009000\"}\n"
            "{\"cmd\":\"close\",\"status\":\"SUCCESS\"}\n"
            "{\"cmd\":\"close\",\"status\":\"FAILED\"}\n"
            "{\"cmd\":\"sleep\",\"ms\":5}\n");
  EXPECT_EQ(se->lastP2(), 4);
  EXPECT_EQ(se->lastClose(), 9);
  EXPECT_EQ(se->lastTransmit(), (std::vector<uint8_t>{0x80, 0xCA, 0x9F, 0x7F, 0x00}));
}

TEST_F(SecliProcessTest, HumanOutputAndExitStatuses) {
  start();
  Outcome o = run({"-i", "SIM1", "transmit", "00 A4 04 00 02 6A 82"});
  EXPECT_EQ(o.status, 0);
  EXPECT_EQ(o.out, "00 A4 04 00 02 6A 82 90 00 (9000: OK)\n");

  // Usage errors (2) and a missing instance (1): one line on standard error.
  const std::pair<std::vector<std::string>, int> failures[] = {
      {{"-i", "SIM1", "transmit", "0G"}, 2}, {{"-i", "SIM1", "frob"}, 2}, {{"present"}, 2},
      {{"-i", "eSE1", "present"}, 1}};
  for (const auto& f : failures) {
    o = run(f.first);
    EXPECT_EQ(o.status, f.second) << ::testing::PrintToString(f.first);
    EXPECT_EQ(o.out, "");
    EXPECT_EQ(lineCount(o.err), 1u) << o.err;
  }

  // A call that fails in transport: an error object and status 1; the script stops there.
  se->skipResult = true;
  o = run({"--json", "-i", "SIM1", "-f", "-"}, "present\natr\npresent\n");
  EXPECT_EQ(o.status, 1);
  EXPECT_EQ(o.out,
            "{\"cmd\":\"present\",\"present\":true}\n"
            "{\"cmd\":\"atr\",\"error\":\"getAtr returned without a result\"}\n");
  EXPECT_EQ(lineCount(o.err), 1u) << o.err;
}

TEST_F(SecliProcessTest, ScriptFileIsCheckedBeforeAnythingRuns) {
  start();
  const std::string file = root.path() + "/script.txt";
  std::ofstream(file) << "transmit 0102\nopen A0 1 2 3\n";
  Outcome o = run({"-i", "SIM1", "-f", file});
  EXPECT_EQ(o.status, 2);
  EXPECT_NE(o.err.find("script.txt:2:"), std::string::npos) << o.err;
  EXPECT_TRUE(se->lastTransmit().empty());
  std::ofstream(file) << "transmit 0102\npresent\n";
  o = run({"--json", "-i", "SIM1", "-f", file});
  EXPECT_EQ(o.status, 0);
  EXPECT_EQ(lineCount(o.out), 2u);
}

TEST_F(SecliProcessTest, InitWaitsForALateStateChangeUpToTheTimeout) {
  se->deferStateChange = true;
  start();
  Process p(argv({"--json", "--timeout", "10", "-i", "SIM1", "init"}), root.path());
  ASSERT_TRUE(se->waitInit());
  // Returns once secli has read and answered the call.
  EXPECT_TRUE(se->callback()->onStateChange(true).isOk());
  EXPECT_EQ(p.waitExit(), 0);
  EXPECT_EQ(p.out().text(), "{\"cmd\":\"init\",\"state\":true}\n");

  Outcome o = run({"--json", "--timeout", "0.2", "-i", "SIM1", "init"});
  EXPECT_EQ(o.status, 0);
  EXPECT_EQ(o.out, "{\"cmd\":\"init\",\"state\":null}\n");
}

TEST_F(SecliProcessTest, KillingSecliMidScriptMakesTheServerSeeServiceDied) {
  start();
  Process p(argv({"--json", "-i", "SIM1", "-f", "-"}), root.path());
  p.write("init\npresent\n");
  size_t pos = 0;
  std::string line;
  ASSERT_TRUE(p.out().nextLine(&pos, &line));
  ASSERT_TRUE(p.out().nextLine(&pos, &line));
  EXPECT_TRUE(se->watcher->cookies().empty());
  p.stop(SIGKILL);
  EXPECT_TRUE(se->watcher->waitDeaths(1));
  EXPECT_EQ(se->watcher->cookies(), std::vector<uint64_t>{0});
}

// list, and --wait for an instance that is not there yet: given up after the
// time asked for, or served once it comes.
TEST_F(SecliProcessTest, ListShowsRegisteredInstances) {
  Outcome o = run({"list", "--wait", "0.1"});
  EXPECT_EQ(o.status, 1);
  EXPECT_EQ(o.out, "");
  EXPECT_EQ(lineCount(o.err), 1u);
  o = run({"--wait", "0.1", "-i", "SIM1", "present"});
  EXPECT_EQ(o.status, 1);
  EXPECT_NE(o.err.find("secli: no instance SIM1"), std::string::npos) << o.err;
  Process waiting(argv({"--wait", "20", "-i", "SIM1", "present"}), root.path());
  waiting.closeStdin();
  start();
  EXPECT_EQ(waiting.waitExit(), 0) << waiting.err().text();
  EXPECT_EQ(waiting.out().text(), "present=true\n");
  o = run({"list"});
  EXPECT_EQ(o.status, 0);
  EXPECT_EQ(o.out, "SIM1\n");
  o = run({"--json", "list", "--wait", "5"});
  EXPECT_EQ(o.out, "{\"cmd\":\"list\",\"instances\":[\"SIM1\"]}\n");
  o = run({"--help"});
  EXPECT_EQ(o.status, 0);
  EXPECT_NE(o.out.find("Usage:"), std::string::npos);
}

}  // namespace

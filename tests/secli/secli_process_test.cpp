// The secli program against the fake secure element served over the real
// socket by this test process.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>

#include <fstream>
#include <sstream>

#include "../platform/rpc_test_util.h"

extern char** environ;

namespace {

using namespace fake;

struct Proc {
  pid_t pid = -1;
  int in = -1, out = -1, err = -1;
};

Proc spawnSecli(const std::vector<std::string>& args) {
  int in[2], out[2], err[2];
  Proc p;
  if (pipe2(in, O_CLOEXEC) || pipe2(out, O_CLOEXEC) || pipe2(err, O_CLOEXEC)) return p;
  posix_spawn_file_actions_t fa;
  posix_spawn_file_actions_init(&fa);
  posix_spawn_file_actions_adddup2(&fa, in[0], 0);
  posix_spawn_file_actions_adddup2(&fa, out[1], 1);
  posix_spawn_file_actions_adddup2(&fa, err[1], 2);
  std::vector<std::string> all = {SECLI_PATH};
  all.insert(all.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (auto& a : all) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  if (posix_spawn(&p.pid, SECLI_PATH, &fa, nullptr, argv.data(), environ) != 0) p.pid = -1;
  posix_spawn_file_actions_destroy(&fa);
  close(in[0]);
  close(out[1]);
  close(err[1]);
  p.in = in[1];
  p.out = out[0];
  p.err = err[0];
  return p;
}

// Reads one line from `fd` (without the newline), waiting at most the test limit.
bool readLine(int fd, std::string* line) {
  line->clear();
  for (;;) {
    pollfd pfd{fd, POLLIN, 0};
    if (poll(&pfd, 1, 10000) != 1) return false;
    char c;
    if (read(fd, &c, 1) != 1) return false;
    if (c == '\n') return true;
    *line += c;
  }
}

struct Outcome {
  int status = -1;
  std::string out, err;
};

// Feeds `input`, closes standard input and collects everything until exit.
Outcome finish(Proc& p, const std::string& input = "") {
  Outcome o;
  if (!input.empty() && write(p.in, input.data(), input.size()) != static_cast<ssize_t>(input.size())) {
    ADD_FAILURE() << "cannot feed secli";
  }
  close(p.in);
  p.in = -1;
  bool outOpen = true, errOpen = true;
  while (outOpen || errOpen) {
    pollfd pfds[2] = {{outOpen ? p.out : -1, POLLIN, 0}, {errOpen ? p.err : -1, POLLIN, 0}};
    if (poll(pfds, 2, 10000) <= 0) {
      ADD_FAILURE() << "secli did not finish";
      kill(p.pid, SIGKILL);
      break;
    }
    char buf[4096];
    for (int i = 0; i < 2; ++i) {
      if (!(pfds[i].revents & (POLLIN | POLLHUP))) continue;
      ssize_t n = read(pfds[i].fd, buf, sizeof(buf));
      if (n <= 0) {
        (i == 0 ? outOpen : errOpen) = false;
      } else {
        (i == 0 ? o.out : o.err).append(buf, static_cast<size_t>(n));
      }
    }
  }
  close(p.out);
  close(p.err);
  int st = 0;
  waitpid(p.pid, &st, 0);
  o.status = WIFEXITED(st) ? WEXITSTATUS(st) : -1;
  return o;
}

Outcome runSecli(const std::vector<std::string>& args, const std::string& input = "") {
  Proc p = spawnSecli(args);
  EXPECT_GT(p.pid, 0);
  return finish(p, input);
}

size_t lineCount(const std::string& s) { return std::count(s.begin(), s.end(), '\n'); }

class SecliProcessTest : public ::testing::Test {
 protected:
  void start() { server = std::make_unique<Server>(se, "SIM1", 2); }
  void TearDown() override {
    if (server) server->stop();
  }
  TempRoot root;
  sp<FakeSecureElement> se = new FakeSecureElement();
  std::unique_ptr<Server> server;
};

TEST_F(SecliProcessTest, ScriptOfEveryCommandPrintsOneJsonLineEach) {
  start();
  const std::string script =
      "# every command once\n"
      "init\n"
      "present\n"
      "atr\n"
      "open A0000001510000 0x0C\n"
      "\n"
      "basic \"a0 02\" 4\n"
      "transmit 80 ca 9F7F 00   # trailing comment\n"
      "close 1\n"
      "close 0x09\n"
      "sleep 5\n";
  Outcome o = runSecli({"--root", root.path(), "--json", "-i", "SIM1", "-f", "-"}, script);
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
  Outcome o = runSecli({"--root", root.path(), "-i", "SIM1", "open", "A0000001510000"});
  EXPECT_EQ(o.status, 0);
  EXPECT_EQ(o.out, "SUCCESS channel=1 select=6F0AA00000015100009000 (9000: OK)\n");

  o = runSecli({"--root", root.path(), "-i", "SIM1", "transmit", "00 A4 04 00 02 6A 82"});
  EXPECT_EQ(o.status, 0);
  EXPECT_EQ(o.out, "00 A4 04 00 02 6A 82 90 00 (9000: OK)\n");

  // Usage errors: one line on standard error, nothing run.
  for (const std::vector<std::string>& args :
       {std::vector<std::string>{"-i", "SIM1", "transmit", "0G"},
        std::vector<std::string>{"-i", "SIM1", "frob"}, std::vector<std::string>{"present"}}) {
    std::vector<std::string> all = {"--root", root.path()};
    all.insert(all.end(), args.begin(), args.end());
    o = runSecli(all);
    EXPECT_EQ(o.status, 2);
    EXPECT_EQ(o.out, "");
    EXPECT_EQ(lineCount(o.err), 1u) << o.err;
  }

  // Missing instance.
  o = runSecli({"--root", root.path(), "-i", "eSE1", "present"});
  EXPECT_EQ(o.status, 1);
  EXPECT_EQ(lineCount(o.err), 1u) << o.err;

  // A call that fails in transport: an error object and status 1; the script stops there.
  se->skipResult = true;
  o = runSecli({"--root", root.path(), "--json", "-i", "SIM1", "-f", "-"}, "present\natr\npresent\n");
  EXPECT_EQ(o.status, 1);
  EXPECT_EQ(o.out.substr(0, o.out.find('\n') + 1), "{\"cmd\":\"present\",\"present\":true}\n");
  EXPECT_EQ(lineCount(o.out), 2u) << o.out;
  EXPECT_NE(o.out.find("{\"cmd\":\"atr\",\"error\":\"getAtr returned without a result\"}"),
            std::string::npos)
      << o.out;
  EXPECT_EQ(lineCount(o.err), 1u) << o.err;
}

TEST_F(SecliProcessTest, ScriptFileIsCheckedBeforeAnythingRuns) {
  start();
  std::string file = root.path() + "/script.txt";
  std::ofstream(file) << "transmit 0102\nopen A0 1 2 3\n";
  Outcome o = runSecli({"--root", root.path(), "-i", "SIM1", "-f", file});
  EXPECT_EQ(o.status, 2);
  EXPECT_NE(o.err.find("script.txt:2:"), std::string::npos) << o.err;
  EXPECT_TRUE(se->lastTransmit().empty());

  std::ofstream(file) << "transmit 0102\npresent\n";
  o = runSecli({"--root", root.path(), "--json", "-i", "SIM1", "-f", file});
  EXPECT_EQ(o.status, 0);
  EXPECT_EQ(lineCount(o.out), 2u);
}

TEST_F(SecliProcessTest, InitWaitsForALateStateChangeUpToTheTimeout) {
  se->deferStateChange = true;
  start();
  Proc p = spawnSecli({"--root", root.path(), "--json", "--timeout", "10", "-i", "SIM1", "init"});
  ASSERT_TRUE(se->waitInit());
  // Returns once secli has read and answered the call.
  EXPECT_TRUE(se->callback()->onStateChange(true).isOk());
  Outcome o = finish(p);
  EXPECT_EQ(o.status, 0);
  EXPECT_EQ(o.out, "{\"cmd\":\"init\",\"state\":true}\n");

  o = runSecli({"--root", root.path(), "--json", "--timeout", "0.2", "-i", "SIM1", "init"});
  EXPECT_EQ(o.status, 0);
  EXPECT_EQ(o.out, "{\"cmd\":\"init\",\"state\":null}\n");
}

TEST_F(SecliProcessTest, KillingSecliMidScriptMakesTheServerSeeServiceDied) {
  start();
  Proc p = spawnSecli({"--root", root.path(), "--json", "-i", "SIM1", "-f", "-"});
  ASSERT_GT(p.pid, 0);
  const std::string first = "init\npresent\n";
  ASSERT_EQ(write(p.in, first.data(), first.size()), static_cast<ssize_t>(first.size()));
  std::string line;
  ASSERT_TRUE(readLine(p.out, &line));
  EXPECT_EQ(line, "{\"cmd\":\"init\",\"state\":true}");
  ASSERT_TRUE(readLine(p.out, &line));
  EXPECT_TRUE(se->watcher->cookies().empty());
  kill(p.pid, SIGKILL);
  int st;
  waitpid(p.pid, &st, 0);
  EXPECT_TRUE(se->watcher->waitDeaths(1));
  EXPECT_EQ(se->watcher->cookies(), std::vector<uint64_t>{0});
  close(p.in);
  close(p.out);
  close(p.err);
}

TEST_F(SecliProcessTest, ListShowsRegisteredInstances) {
  Outcome o = runSecli({"--root", root.path(), "list", "--wait", "0.1"});
  EXPECT_EQ(o.status, 1);
  EXPECT_EQ(o.out, "");
  EXPECT_EQ(lineCount(o.err), 1u);
  start();
  o = runSecli({"--root", root.path(), "list"});
  EXPECT_EQ(o.status, 0);
  EXPECT_EQ(o.out, "SIM1\n");
  o = runSecli({"--root", root.path(), "--json", "list", "--wait", "5"});
  EXPECT_EQ(o.out, "{\"cmd\":\"list\",\"instances\":[\"SIM1\"]}\n");
  o = runSecli({"--help"});
  EXPECT_EQ(o.status, 0);
  EXPECT_NE(o.out.find("Usage:"), std::string::npos);
}

}  // namespace

// secli's parsing and output, without processes.
#include <gtest/gtest.h>

#include "secli_lib.h"

namespace {

using namespace secli;

TEST(SecliParse, Hex) {
  struct Case {
    const char* text;
    bool ok;
    std::vector<uint8_t> want;
  };
  const Case cases[] = {
      {"00A40400", true, {0x00, 0xA4, 0x04, 0x00}},
      {"00a4 04 00", true, {0x00, 0xA4, 0x04, 0x00}},
      {" 6f0A\t90 00 ", true, {0x6F, 0x0A, 0x90, 0x00}},
      {"0 0 a 4", true, {0x00, 0xA4}},
      {"", true, {}},
      {"ABC", false, {}},
      {"0G", false, {}},
      {"0x00", false, {}},
      {"00-A4", false, {}},
  };
  for (const Case& c : cases) {
    std::vector<uint8_t> got = {0x55};
    std::string error;
    EXPECT_EQ(parseHex(c.text, &got, &error), c.ok) << c.text;
    if (c.ok) {
      EXPECT_EQ(got, c.want) << c.text;
    } else {
      EXPECT_FALSE(error.empty()) << c.text;
    }
  }
}

TEST(SecliParse, ByteInDecimalOrHex) {
  struct Case {
    const char* text;
    bool ok;
    uint8_t want;
  };
  const Case cases[] = {
      {"0", true, 0},      {"12", true, 12},     {"255", true, 255}, {"0x0C", true, 12},
      {"0XfF", true, 255}, {"007", true, 7},     {"256", false, 0},  {"0x100", false, 0},
      {"-1", false, 0},    {"0x", false, 0},     {"", false, 0},     {"1e2", false, 0},
      {"0C", false, 0},    {" 1", false, 0},
  };
  for (const Case& c : cases) {
    uint8_t got = 0xEE;
    EXPECT_EQ(parseByte(c.text, &got), c.ok) << c.text;
    if (c.ok) {
      EXPECT_EQ(got, c.want) << c.text;
    }
  }
}

TEST(SecliParse, Commands) {
  struct Case {
    std::vector<std::string> words;
    bool ok;
    CommandKind kind;
    std::vector<uint8_t> bytes;
    uint8_t p2;
    uint8_t channel;
    uint32_t ms;
  };
  const Case cases[] = {
      {{"init"}, true, CommandKind::Init, {}, 0, 0, 0},
      {{"present"}, true, CommandKind::Present, {}, 0, 0, 0},
      {{"atr"}, true, CommandKind::Atr, {}, 0, 0, 0},
      {{"open", "A000000151"}, true, CommandKind::Open, {0xA0, 0, 0, 1, 0x51}, 0, 0, 0},
      {{"open", "a0 01", "0x0C"}, true, CommandKind::Open, {0xA0, 0x01}, 12, 0, 0},
      {{"basic", "", "4"}, true, CommandKind::Basic, {}, 4, 0, 0},
      {{"transmit", "00", "A4", "0400"}, true, CommandKind::Transmit, {0, 0xA4, 4, 0}, 0, 0, 0},
      {{"close", "0x13"}, true, CommandKind::Close, {}, 0, 19, 0},
      {{"close", "3"}, true, CommandKind::Close, {}, 0, 3, 0},
      {{"sleep", "250"}, true, CommandKind::Sleep, {}, 0, 0, 250},
      {{}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"frob"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"init", "x"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"open"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"open", "A0", "1", "2"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"open", "A0", "300"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"basic", "XYZ"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"transmit"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"transmit", "00A"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"close"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"close", "-1"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"sleep", "-5"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"sleep", "10ms"}, false, CommandKind::Init, {}, 0, 0, 0},
      {{"sleep", "99999999999"}, false, CommandKind::Init, {}, 0, 0, 0},
  };
  for (const Case& c : cases) {
    std::string label;
    for (auto& w : c.words) label += "[" + w + "]";
    Command cmd;
    std::string error;
    ASSERT_EQ(parseCommand(c.words, &cmd, &error), c.ok) << label << " " << error;
    if (!c.ok) {
      EXPECT_FALSE(error.empty()) << label;
      continue;
    }
    EXPECT_EQ(cmd.kind, c.kind) << label;
    EXPECT_EQ(cmd.name, c.words[0]) << label;
    EXPECT_EQ(cmd.bytes, c.bytes) << label;
    EXPECT_EQ(cmd.p2, c.p2) << label;
    EXPECT_EQ(cmd.channel, c.channel) << label;
    EXPECT_EQ(cmd.ms, c.ms) << label;
  }
}

TEST(SecliParse, ScriptLines) {
  struct Case {
    const char* line;
    bool ok;
    std::vector<std::string> words;
  };
  const Case cases[] = {
      {"open A0000001 0x01", true, {"open", "A0000001", "0x01"}},
      {"  transmit 00 A4\t04 00  \r\n", true, {"transmit", "00", "A4", "04", "00"}},
      {"# a comment", true, {}},
      {"", true, {}},
      {"close 1 # why", true, {"close", "1"}},
      {"open \"A0 00 01\" 4", true, {"open", "A0 00 01", "4"}},
      {"basic \"\"", true, {"basic", ""}},
      {"open \"A0#1\"", true, {"open", "A0#1"}},
      {"open \"A0", false, {}},
  };
  for (const Case& c : cases) {
    std::vector<std::string> words;
    std::string error;
    EXPECT_EQ(splitLine(c.line, &words, &error), c.ok) << c.line;
    if (c.ok) {
      EXPECT_EQ(words, c.words) << c.line;
    }
  }
}

TEST(SecliParse, ArgumentsAndHelpOnEveryLevel) {
  struct Case {
    std::vector<std::string> args;
    ArgsOutcome outcome;
    const char* messageHas;
  };
  const Case cases[] = {
      {{"--help"}, ArgsOutcome::Help, "Usage:"},
      {{"-h"}, ArgsOutcome::Help, "Commands:"},
      {{"list", "--help"}, ArgsOutcome::Help, "list [--wait SECONDS]"},
      {{"-i", "SIM1", "open", "--help"}, ArgsOutcome::Help, "open AID [P2]"},
      {{"transmit", "--help"}, ArgsOutcome::Help, "transmit APDU"},
      {{"help", "close"}, ArgsOutcome::Help, "close CHANNEL"},
      {{"list"}, ArgsOutcome::Run, ""},
      {{"--root", "/r", "list", "--wait", "2.5"}, ArgsOutcome::Run, ""},
      {{"-i", "SIM1", "present"}, ArgsOutcome::Run, ""},
      {{"--json", "--timeout", "0.5", "-i", "SIM1", "-f", "-"}, ArgsOutcome::Run, ""},
      {{}, ArgsOutcome::Usage, "no command"},
      {{"present"}, ArgsOutcome::Usage, "-i NAME"},
      {{"-i", "SIM1", "frob"}, ArgsOutcome::Usage, "unknown command"},
      {{"-i", "SIM1", "transmit", "0G"}, ArgsOutcome::Usage, "not hex"},
      {{"-i", "SIM1", "-f", "x", "present"}, ArgsOutcome::Usage, "either"},
      {{"--timeout", "0", "-i", "SIM1", "present"}, ArgsOutcome::Usage, "--timeout"},
      {{"--timeout", "soon", "-i", "SIM1", "present"}, ArgsOutcome::Usage, "--timeout"},
      {{"--bogus", "list"}, ArgsOutcome::Usage, "unknown option"},
      {{"-i"}, ArgsOutcome::Usage, "needs a value"},
      {{"list", "--wait"}, ArgsOutcome::Usage, "list [--wait"},
      {{"list", "extra"}, ArgsOutcome::Usage, "list [--wait"},
  };
  for (const Case& c : cases) {
    std::string label;
    for (auto& a : c.args) label += a + " ";
    Options o;
    std::string message;
    EXPECT_EQ(parseArgs(c.args, &o, &message), c.outcome) << label;
    EXPECT_NE(message.find(c.messageHas), std::string::npos) << label << ": " << message;
  }
  Options o;
  std::string message;
  ASSERT_EQ(parseArgs({"--root", "/r", "--json", "--timeout", "2.5", "-i", "eSE1", "-f", "s.txt"},
                      &o, &message),
            ArgsOutcome::Run);
  EXPECT_EQ(o.root, "/r");
  EXPECT_TRUE(o.json);
  EXPECT_EQ(o.timeoutMs, 2500);
  EXPECT_EQ(o.instance, "eSE1");
  EXPECT_EQ(o.script, "s.txt");
  EXPECT_FALSE(o.chain);
  ASSERT_EQ(parseArgs({"--chain", "--trace", "-i", "eSE1", "present"}, &o, &message),
            ArgsOutcome::Run);
  EXPECT_TRUE(o.chain);
  EXPECT_TRUE(o.trace);
  ASSERT_EQ(parseArgs({"list", "--wait", "3"}, &o, &message), ArgsOutcome::Run);
  EXPECT_TRUE(o.list);
  EXPECT_EQ(o.listWaitMs, 3000);
}

Result result(CommandKind kind, const char* cmd) {
  Result r;
  r.kind = kind;
  r.cmd = cmd;
  return r;
}

TEST(SecliOutput, JsonAndHumanLines) {
  const std::vector<uint8_t> select = {0x6F, 0x0A, 0x84, 0x08, 0x90, 0x00};
  struct Case {
    Result r;
    const char* json;
    const char* human;
  };
  std::vector<Case> cases;
  {
    Result r = result(CommandKind::Open, "open");
    r.channel = 1;
    r.data = select;
    cases.push_back({r, R"({"cmd":"open","status":"SUCCESS","channel":1,"select":"6F0A84089000"})",
                     "SUCCESS channel=1 select=6F0A84089000 (9000: OK)"});
    r.status = SecureElementStatus::NO_SUCH_ELEMENT_ERROR;
    r.channel = 0;
    r.data = {0x6A, 0x82};
    cases.push_back({r,
                     R"({"cmd":"open","status":"NO_SUCH_ELEMENT_ERROR","channel":0,"select":"6A82"})",
                     "NO_SUCH_ELEMENT_ERROR channel=0 select=6A82 (6A82: file or application not found)"});
  }
  {
    Result r = result(CommandKind::Basic, "basic");
    r.data = {0x90, 0x00};
    cases.push_back({r, R"({"cmd":"basic","status":"SUCCESS","select":"9000"})",
                     "SUCCESS select=9000 (9000: OK)"});
  }
  {
    Result r = result(CommandKind::Transmit, "transmit");
    r.data = {0x90, 0x00};
    cases.push_back({r, R"({"cmd":"transmit","response":"9000"})", "90 00 (9000: OK)"});
    r.data = {0x01, 0x6C, 0x10};
    cases.push_back({r, R"({"cmd":"transmit","response":"016C10"})",
                     "01 6C 10 (6C10: wrong Le, exact length 16)"});
    r.data = {0x12, 0x34};
    cases.push_back({r, R"({"cmd":"transmit","response":"1234"})", "12 34 (1234)"});
    r.data = {};
    cases.push_back({r, R"({"cmd":"transmit","response":""})", "(empty response)"});
  }
  {
    Result r = result(CommandKind::Init, "init");
    r.state = true;
    cases.push_back({r, R"({"cmd":"init","state":true})", "state=true"});
    r.state.reset();
    r.waitedSeconds = 2.5;
    cases.push_back({r, R"({"cmd":"init","state":null})",
                     "state=none (no onStateChange within 2.5 s)"});
  }
  {
    Result r = result(CommandKind::Present, "present");
    r.present = true;
    cases.push_back({r, R"({"cmd":"present","present":true})", "present=true"});
    r.present = false;
    cases.push_back({r, R"({"cmd":"present","present":false})", "present=false"});
  }
  {
    Result r = result(CommandKind::Atr, "atr");
    r.data = {0x3B, 0x8F, 0x80};
    cases.push_back({r, R"({"cmd":"atr","atr":"3B8F80"})", "atr=3B 8F 80"});
  }
  {
    Result r = result(CommandKind::Close, "close");
    r.status = SecureElementStatus::FAILED;
    cases.push_back({r, R"({"cmd":"close","status":"FAILED"})", "FAILED"});
  }
  {
    Result r = result(CommandKind::Sleep, "sleep");
    r.ms = 20;
    cases.push_back({r, R"({"cmd":"sleep","ms":20})", ""});
  }
  {
    Result r = result(CommandKind::Transmit, "transmit");
    r.error = "connection \"lost\"\n\x01";
    cases.push_back({r, R"({"cmd":"transmit","error":"connection \"lost\"\n\u0001"})", ""});
  }
  for (const Case& c : cases) {
    EXPECT_EQ(formatJson(c.r), c.json);
    EXPECT_EQ(formatHuman(c.r), c.human);
  }
}

TEST(SecliOutput, StatusWordCatalogue) {
  struct Case {
    uint8_t sw1, sw2;
    const char* want;
  };
  const Case cases[] = {
      {0x90, 0x00, "OK"},
      {0x61, 0x1A, "more data, 26 bytes available"},
      {0x61, 0x00, "more data, 256 bytes available"},
      {0x6C, 0x05, "wrong Le, exact length 5"},
      {0x6A, 0x82, "file or application not found"},
      {0x6A, 0x81, "function not supported"},
      {0x6D, 0x00, "INS not supported"},
      {0x6E, 0x00, "CLA not supported"},
      {0x68, 0x81, "logical channel not supported"},
      {0x67, 0x00, "wrong length"},
      {0x6A, 0x86, "incorrect P1-P2"},
      {0x69, 0x85, "conditions of use not satisfied"},
      {0x69, 0x82, "security status not satisfied"},
      {0x6F, 0x00, "no precise diagnosis"},
      {0x63, 0xC2, "verification failed, 2 tries left"},
      {0x12, 0x34, ""},
  };
  for (const Case& c : cases) EXPECT_EQ(describeStatusWord(c.sw1, c.sw2), c.want);
  EXPECT_EQ(statusWordNote({0x90}), "");
  EXPECT_EQ(hexGrouped({0x00, 0xAB, 0x0F}), "00 AB 0F");
  EXPECT_EQ(hexCompact({0x00, 0xab, 0x0f}), "00AB0F");
}

// Every help line fits a terminal and each command starts its own line.
TEST(SecliHelp, LinesFitAndEveryCommandHasItsOwnLine) {
  const std::string help = mainHelp();
  size_t start = 0;
  for (size_t nl = help.find('\n'); nl != std::string::npos; nl = help.find('\n', start)) {
    EXPECT_LE(nl - start, 79u) << help.substr(start, nl - start);
    start = nl + 1;
  }
  for (const char* usage : {"init", "present", "atr", "open AID [P2]", "basic AID [P2]",
                            "transmit APDU", "close CHANNEL", "sleep MS", "list [--wait SECONDS]"}) {
    EXPECT_NE(help.find(std::string("\n  ") + usage + (usage[0] == 'l' ? "\n" : " ")),
              std::string::npos)
        << usage;
  }
}

using Bytes = std::vector<uint8_t>;

TEST(SecliChain, ChannelInClaOfGetResponseAndLeRewrite) {
  const std::pair<uint8_t, uint8_t> clas[] = {
      {0x00, 0x00}, {0x03, 0x03}, {0x81, 0x01}, {0x0C, 0x00}, {0x40, 0x40}, {0x4F, 0x4F}, {0xCA, 0x4A}};
  for (const auto& c : clas) EXPECT_EQ(getResponseCla(c.first), c.second) << int(c.first);
  EXPECT_EQ(channelOfCla(0x41), 5);
  EXPECT_EQ(channelOfCla(0x4F), 19);

  const std::pair<Bytes, Bytes> les[] = {
      {{0x00, 0xCA, 0x00, 0x66}, {0x00, 0xCA, 0x00, 0x66, 0x10}},              // case 1
      {{0x00, 0xCA, 0x00, 0x66, 0x00}, {0x00, 0xCA, 0x00, 0x66, 0x10}},        // case 2
      {{0x01, 0x01, 0x00, 0x00, 0x01, 0xAA}, {0x01, 0x01, 0x00, 0x00, 0x01, 0xAA, 0x10}},  // 3
      {{0x01, 0x01, 0x00, 0x00, 0x01, 0xAA, 0x05}, {0x01, 0x01, 0x00, 0x00, 0x01, 0xAA, 0x10}},
      {{0x00, 0xCA, 0x00}, {}},                                               // too short
      {{0x00, 0xCA, 0x00, 0x00, 0x00, 0x01, 0x00}, {}},                         // extended
      {{0x01, 0x01, 0x00, 0x00, 0x03, 0xAA}, {}},                               // Lc too long
  };
  for (const auto& c : les) EXPECT_EQ(withLe(c.first, 0x10), c.second) << c.first.size();
}

// A scripted card: each command sent is recorded and answered from a list.
struct FakeLink {
  std::vector<Bytes> answers;
  std::vector<Bytes> sent;
  TransmitFn fn() {
    return [this](const Bytes& apdu) {
      sent.push_back(apdu);
      if (sent.size() > answers.size()) return Bytes{0x6F, 0x00};
      return answers[sent.size() - 1];
    };
  }
};

TEST(SecliChain, FollowsTheCardLikeAFramework) {
  struct Case {
    const char* what;
    Bytes apdu;
    std::vector<Bytes> answers;
    std::vector<Bytes> wantSent;
    Bytes want;
  };
  const Case cases[] = {
      {"plain answer", {0x01, 0x01, 0x00, 0x00, 0x01, 0xAA}, {{0xAA, 0x90, 0x00}},
       {{0x01, 0x01, 0x00, 0x00, 0x01, 0xAA}}, {0xAA, 0x90, 0x00}},
      {"two GET RESPONSE parts on channel 2",
       {0x02, 0x11, 0x00, 0x04, 0x00},
       {{0x61, 0x02}, {0x00, 0x01, 0x61, 0x02}, {0x02, 0x03, 0x90, 0x00}},
       {{0x02, 0x11, 0x00, 0x04, 0x00}, {0x02, 0xC0, 0x00, 0x00, 0x02}, {0x02, 0xC0, 0x00, 0x00, 0x02}},
       {0x00, 0x01, 0x02, 0x03, 0x90, 0x00}},
      {"GET RESPONSE on channel 6 in a further class",
       {0x42, 0xCA, 0x00, 0x66, 0x00},
       {{0x61, 0x01}, {0x7F, 0x90, 0x00}},
       {{0x42, 0xCA, 0x00, 0x66, 0x00}, {0x42, 0xC0, 0x00, 0x00, 0x01}},
       {0x7F, 0x90, 0x00}},
      {"6C then the exact Le, then more data",
       {0x01, 0x01, 0x00, 0x00, 0x02, 0xAB, 0xCD, 0x05},
       {{0x6C, 0x02}, {0x61, 0x02}, {0xAB, 0xCD, 0x90, 0x00}},
       {{0x01, 0x01, 0x00, 0x00, 0x02, 0xAB, 0xCD, 0x05},
        {0x01, 0x01, 0x00, 0x00, 0x02, 0xAB, 0xCD, 0x02},
        {0x01, 0xC0, 0x00, 0x00, 0x02}},
       {0xAB, 0xCD, 0x90, 0x00}},
      {"a second 6C is the answer", {0x00, 0xCA, 0x00, 0x66, 0x00}, {{0x6C, 0x03}, {0x6C, 0x04}},
       {{0x00, 0xCA, 0x00, 0x66, 0x00}, {0x00, 0xCA, 0x00, 0x66, 0x03}}, {0x6C, 0x04}},
      {"error status ends the chain with the parts so far",
       {0x00, 0xB0, 0x00, 0x00, 0x00},
       {{0x61, 0x01}, {0x6A, 0x82}},
       {{0x00, 0xB0, 0x00, 0x00, 0x00}, {0x00, 0xC0, 0x00, 0x00, 0x01}},
       {0x6A, 0x82}},
      {"a one-byte first answer is kept as it came", {0x01, 0x01, 0x00, 0x00, 0x01, 0xAA}, {{0x1F}},
       {{0x01, 0x01, 0x00, 0x00, 0x01, 0xAA}}, {0x1F}},
      {"an empty answer fails the whole exchange",
       {0x00, 0xB0, 0x00, 0x00, 0x00},
       {{0x10, 0x61, 0x01}, {}},
       {{0x00, 0xB0, 0x00, 0x00, 0x00}, {0x00, 0xC0, 0x00, 0x00, 0x01}},
       {}},
  };
  for (const Case& c : cases) {
    FakeLink link;
    link.answers = c.answers;
    int exchanges = 0;
    EXPECT_EQ(transmitChained(c.apdu, link.fn(), &exchanges), c.want) << c.what;
    EXPECT_EQ(link.sent, c.wantSent) << c.what;
    EXPECT_EQ(exchanges, static_cast<int>(c.wantSent.size())) << c.what;
  }
}

TEST(SecliChain, ACardThatNeverStopsIsLeftAfterABound) {
  int calls = 0;
  const Bytes got = transmitChained({0x00, 0xB0, 0x00, 0x00, 0x00}, [&](const Bytes&) {
    ++calls;
    return Bytes{0x55, 0x61, 0x01};
  });
  EXPECT_EQ(calls, 300);
  ASSERT_GE(got.size(), 2u);
  EXPECT_EQ(got[got.size() - 2], 0x61);
}

}  // namespace

namespace {

// AIDL results: the status by name first; results only with SUCCESS; init's
// reason and reset's states.
TEST(SecliOutput, AidlJsonAndHumanLines) {
  auto aidl = [](CommandKind kind, const char* cmd, const char* status) {
    Result r;
    r.kind = kind;
    r.cmd = cmd;
    r.aidl = true;
    r.aidlStatus = status;
    return r;
  };
  struct Case {
    Result r;
    std::string json, human;
  };
  std::vector<Case> cases;
  {
    Result r = aidl(CommandKind::Init, "init", "SUCCESS");
    r.state = true;
    r.reason = "eSE1 is ready";
    cases.push_back({r, R"({"cmd":"init","status":"SUCCESS","state":true,"reason":"eSE1 is ready"})",
                     R"(SUCCESS state=true reason="eSE1 is ready")"});
  }
  {
    Result r = aidl(CommandKind::Reset, "reset", "SUCCESS");
    r.states = {false, true};
    cases.push_back({r, R"({"cmd":"reset","status":"SUCCESS","states":[false,true]})",
                     "SUCCESS states=false,true"});
  }
  {
    Result r = aidl(CommandKind::Reset, "reset", "FAILED");
    r.states = {false};
    r.aidlMessage = "eSE1 did not come back";
    cases.push_back({r, R"({"cmd":"reset","status":"FAILED","message":"eSE1 did not come back","states":[false]})",
                     "FAILED (eSE1 did not come back)"});
  }
  {
    Result r = aidl(CommandKind::Open, "open", "NO_SUCH_ELEMENT_ERROR");
    r.channel = 3;  // not a result of a failed call: not shown
    r.data = {0x90, 0x00};
    cases.push_back({r, R"({"cmd":"open","status":"NO_SUCH_ELEMENT_ERROR"})", "NO_SUCH_ELEMENT_ERROR"});
  }
  {
    Result r = aidl(CommandKind::Open, "open", "SUCCESS");
    r.channel = 2;
    r.data = {0x6F, 0x00, 0x90, 0x00};
    cases.push_back({r, R"({"cmd":"open","status":"SUCCESS","channel":2,"select":"6F009000"})",
                     "SUCCESS channel=2 select=6F009000 (9000: OK)"});
  }
  {
    Result r = aidl(CommandKind::Transmit, "transmit", "CHANNEL_NOT_AVAILABLE");
    cases.push_back({r, R"({"cmd":"transmit","status":"CHANNEL_NOT_AVAILABLE"})",
                     "CHANNEL_NOT_AVAILABLE"});
  }
  {
    Result r = aidl(CommandKind::Close, "close", "SUCCESS");
    cases.push_back({r, R"({"cmd":"close","status":"SUCCESS"})", "SUCCESS"});
  }
  {
    Result r = aidl(CommandKind::Present, "present", "SUCCESS");
    r.error = "connection to the service lost";  // transport errors as for HIDL
    cases.push_back({r, R"({"cmd":"present","error":"connection to the service lost"})", ""});
  }
  for (const Case& c : cases) {
    EXPECT_EQ(formatJson(c.r), c.json);
    EXPECT_EQ(formatHuman(c.r), c.human);
  }
}

TEST(SecliParse, ResetIsAnAidlCommand) {
  Options o;
  std::string message;
  EXPECT_EQ(parseArgs({"-i", "eSE1", "reset"}, &o, &message), ArgsOutcome::Usage);
  EXPECT_NE(message.find("--aidl"), std::string::npos);
  EXPECT_EQ(parseArgs({"--aidl", "-i", "eSE1", "reset"}, &o, &message), ArgsOutcome::Run);
  EXPECT_TRUE(o.aidl);
  EXPECT_EQ(parseArgs({"--aidl", "-i", "eSE1", "reset", "1"}, &o, &message), ArgsOutcome::Usage);
  EXPECT_EQ(aidlInstanceName("SIM1"), "android.hardware.secure_element.ISecureElement/SIM1");
  EXPECT_EQ(AidlSession::connect("a/b", 1000), nullptr);
  EXPECT_NE(mainHelp().find("--aidl"), std::string::npos);
  EXPECT_NE(mainHelp().find("reset"), std::string::npos);
}

}  // namespace

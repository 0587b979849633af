// secli's parsing and output, without processes.
#include <gtest/gtest.h>

#include <functional>

#include "secli_lib.h"

namespace {

using namespace secli;
using Bytes = std::vector<uint8_t>;

TEST(SecliParse, HexAndBytes) {
  const std::pair<const char*, Bytes> good[] = {
      {"00A40400", {0x00, 0xA4, 0x04, 0x00}}, {"00a4 04 00", {0x00, 0xA4, 0x04, 0x00}},
      {" 6f0A\t90 00 ", {0x6F, 0x0A, 0x90, 0x00}}, {"0 0 a 4", {0x00, 0xA4}}, {"", {}}};
  for (const auto& c : good) {
    Bytes got = {0x55};
    std::string error;
    EXPECT_TRUE(parseHex(c.first, &got, &error)) << c.first;
    EXPECT_EQ(got, c.second) << c.first;
  }
  for (const char* bad : {"ABC", "0G", "0x00", "00-A4"}) {
    Bytes got;
    std::string error;
    EXPECT_FALSE(parseHex(bad, &got, &error)) << bad;
    EXPECT_FALSE(error.empty()) << bad;
  }
  const std::pair<const char*, int> bytes[] = {
      {"0", 0},   {"12", 12},    {"255", 255}, {"0x0C", 12}, {"0XfF", 255}, {"007", 7},
      {"256", -1}, {"0x100", -1}, {"-1", -1},  {"0x", -1},   {"", -1},      {"1e2", -1},
      {"0C", -1}, {" 1", -1}};
  for (const auto& c : bytes) {
    uint8_t got = 0xEE;
    EXPECT_EQ(parseByte(c.first, &got), c.second >= 0) << c.first;
    if (c.second >= 0) {
      EXPECT_EQ(got, c.second) << c.first;
    }
  }
}

TEST(SecliParse, Commands) {
  struct Case {
    std::vector<std::string> words;
    CommandKind kind;
    Bytes bytes;
    uint8_t p2, channel;
    uint32_t ms;
  };
  const Case good[] = {
      {{"init"}, CommandKind::Init, {}, 0, 0, 0},
      {{"present"}, CommandKind::Present, {}, 0, 0, 0},
      {{"atr"}, CommandKind::Atr, {}, 0, 0, 0},
      {{"open", "A000000151"}, CommandKind::Open, {0xA0, 0, 0, 1, 0x51}, 0, 0, 0},
      {{"open", "a0 01", "0x0C"}, CommandKind::Open, {0xA0, 0x01}, 12, 0, 0},
      {{"basic", "", "4"}, CommandKind::Basic, {}, 4, 0, 0},
      {{"transmit", "00", "A4", "0400"}, CommandKind::Transmit, {0, 0xA4, 4, 0}, 0, 0, 0},
      {{"close", "0x13"}, CommandKind::Close, {}, 0, 19, 0},
      {{"sleep", "250"}, CommandKind::Sleep, {}, 0, 0, 250},
  };
  for (const Case& c : good) {
    Command cmd;
    std::string error;
    ASSERT_TRUE(parseCommand(c.words, &cmd, &error)) << c.words[0] << " " << error;
    EXPECT_EQ(cmd.kind, c.kind) << c.words[0];
    EXPECT_EQ(cmd.name, c.words[0]);
    EXPECT_EQ(cmd.bytes, c.bytes) << c.words[0];
    EXPECT_EQ(cmd.p2, c.p2) << c.words[0];
    EXPECT_EQ(cmd.channel, c.channel) << c.words[0];
    EXPECT_EQ(cmd.ms, c.ms) << c.words[0];
  }
  const std::vector<std::string> bad[] = {
      {}, {"frob"}, {"init", "x"}, {"open"}, {"open", "A0", "1", "2"}, {"open", "A0", "300"},
      {"basic", "XYZ"}, {"transmit"}, {"transmit", "00A"}, {"close"}, {"close", "-1"},
      {"sleep", "-5"}, {"sleep", "10ms"}, {"sleep", "99999999999"}};
  for (const auto& words : bad) {
    Command cmd;
    std::string error;
    EXPECT_FALSE(parseCommand(words, &cmd, &error)) << ::testing::PrintToString(words);
    EXPECT_FALSE(error.empty()) << ::testing::PrintToString(words);
  }
}

TEST(SecliParse, ScriptLines) {
  const std::pair<const char*, std::vector<std::string>> cases[] = {
      {"open A0000001 0x01", {"open", "A0000001", "0x01"}},
      {"  transmit 00 A4\t04 00  \r\n", {"transmit", "00", "A4", "04", "00"}},
      {"# a comment", {}},
      {"", {}},
      {"close 1 # why", {"close", "1"}},
      {"open \"A0 00 01\" 4", {"open", "A0 00 01", "4"}},
      {"basic \"\"", {"basic", ""}},
      {"open \"A0#1\"", {"open", "A0#1"}},
  };
  for (const auto& c : cases) {
    std::vector<std::string> words;
    std::string error;
    EXPECT_TRUE(splitLine(c.first, &words, &error)) << c.first;
    EXPECT_EQ(words, c.second) << c.first;
  }
  std::vector<std::string> words;
  std::string error;
  EXPECT_FALSE(splitLine("open \"A0", &words, &error));
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
      {{"help", "close"}, ArgsOutcome::Help, "close CHANNEL"},
      {{"list"}, ArgsOutcome::Run, ""},
      {{"-i", "SIM1", "present"}, ArgsOutcome::Run, ""},
      {{"--aidl", "-i", "eSE1", "reset"}, ArgsOutcome::Run, ""},
      {{}, ArgsOutcome::Usage, "no command"},
      {{"present"}, ArgsOutcome::Usage, "-i NAME"},
      {{"-i", "SIM1", "frob"}, ArgsOutcome::Usage, "unknown command"},
      {{"-i", "SIM1", "transmit", "0G"}, ArgsOutcome::Usage, "not hex"},
      {{"-i", "SIM1", "-f", "x", "present"}, ArgsOutcome::Usage, "either"},
      {{"--timeout", "0", "-i", "SIM1", "present"}, ArgsOutcome::Usage, "--timeout"},
      {{"--timeout", "soon", "-i", "SIM1", "present"}, ArgsOutcome::Usage, "--timeout"},
      {{"--wait", "-1", "-i", "SIM1", "present"}, ArgsOutcome::Usage, "--wait"},
      {{"--bogus", "list"}, ArgsOutcome::Usage, "unknown option"},
      {{"-i"}, ArgsOutcome::Usage, "needs a value"},
      {{"list", "--wait"}, ArgsOutcome::Usage, "list [--wait"},
      {{"list", "extra"}, ArgsOutcome::Usage, "list [--wait"},
      {{"-i", "eSE1", "reset"}, ArgsOutcome::Usage, "--aidl"},  // reset is an AIDL call
      {{"--aidl", "-i", "eSE1", "reset", "1"}, ArgsOutcome::Usage, "reset"},
  };
  for (const Case& c : cases) {
    Options o;
    std::string message;
    EXPECT_EQ(parseArgs(c.args, &o, &message), c.outcome) << ::testing::PrintToString(c.args);
    EXPECT_NE(message.find(c.messageHas), std::string::npos) << message;
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
  EXPECT_FALSE(o.chain || o.trace || o.aidl);
  ASSERT_EQ(parseArgs({"--aidl", "--chain", "--trace", "--wait", "1.5", "-i", "eSE1", "present"}, &o,
                      &message),
            ArgsOutcome::Run);
  EXPECT_TRUE(o.chain && o.trace && o.aidl);
  EXPECT_EQ(o.waitMs, 1500);
  ASSERT_EQ(parseArgs({"list", "--wait", "3"}, &o, &message), ArgsOutcome::Run);
  EXPECT_TRUE(o.list);
  EXPECT_EQ(o.listWaitMs, 3000);
  EXPECT_EQ(aidlInstanceName("SIM1"), "android.hardware.secure_element.ISecureElement/SIM1");
  EXPECT_EQ(AidlSession::connect("a/b", 1000), nullptr);
}

Result make(CommandKind kind, const char* cmd, const std::function<void(Result&)>& set,
            const char* aidlStatus = nullptr) {
  Result r;
  r.kind = kind;
  r.cmd = cmd;
  r.aidl = aidlStatus != nullptr;
  if (aidlStatus) r.aidlStatus = aidlStatus;
  set(r);
  return r;
}

// HIDL results as they come; AIDL results with the status by name first,
// results only with SUCCESS, init's reason and reset's states.
TEST(SecliOutput, JsonAndHumanLines) {
  using K = CommandKind;
  struct Case {
    Result r;
    const char* json;
    const char* human;
  };
  const Case cases[] = {
      {make(K::Open, "open", [](Result& r) { r.channel = 1, r.data = {0x6F, 0x0A, 0x90, 0x00}; }),
       R"({"cmd":"open","status":"SUCCESS","channel":1,"select":"6F0A9000"})",
       "SUCCESS channel=1 select=6F0A9000 (9000: OK)"},
      {make(K::Open, "open",
            [](Result& r) { r.status = SecureElementStatus::NO_SUCH_ELEMENT_ERROR, r.data = {0x6A, 0x82}; }),
       R"({"cmd":"open","status":"NO_SUCH_ELEMENT_ERROR","channel":0,"select":"6A82"})",
       "NO_SUCH_ELEMENT_ERROR channel=0 select=6A82 (6A82: file or application not found)"},
      {make(K::Basic, "basic", [](Result& r) { r.data = {0x90, 0x00}; }),
       R"({"cmd":"basic","status":"SUCCESS","select":"9000"})", "SUCCESS select=9000 (9000: OK)"},
      {make(K::Transmit, "transmit", [](Result& r) { r.data = {0x01, 0x6C, 0x10}; }),
       R"({"cmd":"transmit","response":"016C10"})", "01 6C 10 (6C10: wrong Le, exact length 16)"},
      {make(K::Transmit, "transmit", [](Result& r) { r.data = {0x12, 0x34}; }),
       R"({"cmd":"transmit","response":"1234"})", "12 34 (1234)"},
      {make(K::Transmit, "transmit", [](Result&) {}), R"({"cmd":"transmit","response":""})",
       "(empty response)"},
      {make(K::Init, "init", [](Result& r) { r.state = true; }), R"({"cmd":"init","state":true})",
       "state=true"},
      {make(K::Init, "init", [](Result& r) { r.waitedSeconds = 2.5; }),
       R"({"cmd":"init","state":null})", "state=none (no onStateChange within 2.5 s)"},
      {make(K::Present, "present", [](Result& r) { r.present = true; }),
       R"({"cmd":"present","present":true})", "present=true"},
      {make(K::Present, "present", [](Result&) {}), R"({"cmd":"present","present":false})",
       "present=false"},
      {make(K::Atr, "atr", [](Result& r) { r.data = {0x3B, 0x8F, 0x80}; }),
       R"({"cmd":"atr","atr":"3B8F80"})", "atr=3B 8F 80"},
      {make(K::Close, "close", [](Result& r) { r.status = SecureElementStatus::FAILED; }),
       R"({"cmd":"close","status":"FAILED"})", "FAILED"},
      {make(K::Sleep, "sleep", [](Result& r) { r.ms = 20; }), R"({"cmd":"sleep","ms":20})", ""},
      {make(K::Transmit, "transmit", [](Result& r) { r.error = "connection \"lost\"\n\x01"; }),
       R"({"cmd":"transmit","error":"connection \"lost\"\n\u0001"})", ""},
      // AIDL
      {make(K::Init, "init", [](Result& r) { r.state = true, r.reason = "eSE1 is ready"; }, "SUCCESS"),
       R"({"cmd":"init","status":"SUCCESS","state":true,"reason":"eSE1 is ready"})",
       R"(SUCCESS state=true reason="eSE1 is ready")"},
      {make(K::Reset, "reset", [](Result& r) { r.states = {false, true}; }, "SUCCESS"),
       R"({"cmd":"reset","status":"SUCCESS","states":[false,true]})", "SUCCESS states=false,true"},
      {make(K::Reset, "reset", [](Result& r) { r.states = {false}, r.aidlMessage = "gone"; }, "FAILED"),
       R"({"cmd":"reset","status":"FAILED","message":"gone","states":[false]})", "FAILED (gone)"},
      {make(K::Open, "open", [](Result& r) { r.channel = 3, r.data = {0x90, 0x00}; },
            "NO_SUCH_ELEMENT_ERROR"),
       R"({"cmd":"open","status":"NO_SUCH_ELEMENT_ERROR"})", "NO_SUCH_ELEMENT_ERROR"},
      {make(K::Open, "open", [](Result& r) { r.channel = 2, r.data = {0x6F, 0x00, 0x90, 0x00}; },
            "SUCCESS"),
       R"({"cmd":"open","status":"SUCCESS","channel":2,"select":"6F009000"})",
       "SUCCESS channel=2 select=6F009000 (9000: OK)"},
      {make(K::Transmit, "transmit", [](Result&) {}, "CHANNEL_NOT_AVAILABLE"),
       R"({"cmd":"transmit","status":"CHANNEL_NOT_AVAILABLE"})", "CHANNEL_NOT_AVAILABLE"},
      {make(K::Present, "present", [](Result& r) { r.error = "connection lost"; }, "SUCCESS"),
       R"({"cmd":"present","error":"connection lost"})", ""},
  };
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
      {0x6A, 0x81, "function not supported"},
      {0x68, 0x81, "logical channel not supported"},
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
                            "transmit APDU", "close CHANNEL", "sleep MS", "reset"}) {
    EXPECT_NE(help.find(std::string("\n  ") + usage + " "), std::string::npos) << usage;
  }
  EXPECT_NE(help.find("\n  list [--wait SECONDS]\n"), std::string::npos);
  EXPECT_NE(help.find("--aidl"), std::string::npos);
}

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
    std::vector<Bytes> sent;
    int exchanges = 0;
    const Bytes got = transmitChained(c.apdu, [&](const Bytes& apdu) {
      sent.push_back(apdu);
      return sent.size() <= c.answers.size() ? c.answers[sent.size() - 1] : Bytes{0x6F, 0x00};
    }, &exchanges);
    EXPECT_EQ(got, c.want) << c.what;
    EXPECT_EQ(sent, c.wantSent) << c.what;
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

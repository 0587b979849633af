// The daemon with the PC/SC vendor library (LD_LIBRARY_PATH) against the
// virtual card in vpcd's reader, driven by secli: the eSE1 sequences of the
// simulated library's end-to-end tests, and a card pulled out and put back.
#include <gtest/gtest.h>

#include <signal.h>

#include <cstdlib>
#include <memory>
#include <string>

#include "pcsc_env.h"

namespace {

using namespace se_test;

constexpr const char* kEchoAid = "A00000000101";
constexpr const char* kBigAid = "A00000000102";
constexpr const char* kP2Aid = "A00000000103";
constexpr const char* kMissingAid = "A00000000199";

class PcscEndToEnd : public ::testing::Test {
 protected:
  void SetUp() override {
    SE_SKIP_WITHOUT_PCSCD();
    ASSERT_NO_FATAL_FAILURE(env.start());
    root.property("vendor.ese_pcsc.reader=" + env.reader());
  }
  void TearDown() override {
    if (daemon) {
      daemon->stop(SIGKILL);
      expectNoSanitizerReport("daemon", daemon->err().text());
      if (HasFailure()) fprintf(stderr, "---- daemon ----\n%s", daemon->err().text().c_str());
    }
    if (card && HasFailure()) fprintf(stderr, "---- card-vpcd ----\n%s", card->err().text().c_str());
  }
  void start(const std::vector<std::string>& env_ = {}) {
    card = env.startCard();
    std::vector<std::string> argv{"/usr/bin/env", std::string("LD_LIBRARY_PATH=") + kPcscLibDir};
    argv.insert(argv.end(), env_.begin(), env_.end());
    argv.push_back(kDaemon);
    daemon = std::make_unique<Process>(argv, root.path());
    ASSERT_TRUE(daemon->err().waitFor(
        "AIDL Registered android.hardware.secure_element.ISecureElement/SIM1 success"))
        << daemon->err().text();
    // The PC/SC library, not the simulated one, answered for the eSE type.
    ASSERT_TRUE(daemon->err().waitFor("ese_pcsc: get_korva_exist_flag: 1")) << daemon->err().text();
  }
  static int channelOf(const std::string& open) { return std::atoi(field(open, "channel").c_str()); }
  static int openEcho(SecliSession& s) {
    const std::string open = s.call(std::string("open ") + kEchoAid);
    EXPECT_EQ(field(open, "status"), "SUCCESS") << open;
    return field(open, "status") == "SUCCESS" ? channelOf(open) : -1;
  }
  static std::string echo(SecliSession& s, int channel, const std::string& byte) {
    return field(s.call("transmit " + hexByte(channel) + " 01 00 00 01 " + byte), "response");
  }

  TempRoot root;
  PcscEnv env;
  std::unique_ptr<Process> card;
  std::unique_ptr<Process> daemon;
};

TEST_F(PcscEndToEnd, ChannelsAndApdusThroughTheDaemon) {
  ASSERT_NO_FATAL_FAILURE(start());
  SecliSession s(root, "eSE1");
  EXPECT_EQ(s.call("init"), R"({"cmd":"init","state":true})");
  EXPECT_TRUE(daemon->err().waitFor("ese_pcsc: phQvEse_init_open: connected to \"" + env.reader()));
  EXPECT_EQ(field(s.call("present"), "present"), "true");
  EXPECT_EQ(field(s.call("atr"), "atr"), "");

  std::string open = s.call(std::string("open ") + kEchoAid);
  EXPECT_EQ(field(open, "status"), "SUCCESS");
  const int echoCh = channelOf(open);
  ASSERT_GE(echoCh, 1);
  ASSERT_LE(echoCh, 3);
  EXPECT_EQ(field(open, "select"), std::string("6F088406") + kEchoAid + "9000");
  EXPECT_EQ(field(s.call("transmit " + hexByte(echoCh) + " 01 00 00 03 AA BB CC"), "response"), "AABBCC9000");

  // SELECT answered 61 xx: the front fetches the FCI with GET RESPONSE; a
  // command left for GET RESPONSE, fetched by the client itself.
  open = s.call(std::string("open ") + kBigAid);
  EXPECT_EQ(field(open, "status"), "SUCCESS");
  const int big = channelOf(open);
  ASSERT_GE(big, 1);
  EXPECT_NE(big, echoCh);
  EXPECT_TRUE(card->err().waitFor("< " + hexByte(big) + " C0 00 00 1C")) << "the front's GET RESPONSE";
  const std::string fci = field(open, "select");
  EXPECT_EQ(fci.substr(0, 2), "6F");
  EXPECT_EQ(fci.substr(fci.size() - 4), "9000");
  EXPECT_EQ(field(s.call("transmit " + hexByte(big) + " 11 00 10 00"), "response"), "6110");
  EXPECT_EQ(field(s.call("transmit " + hexByte(big) + " C0 00 00 10"), "response"),
            "000102030405060708090A0B0C0D0E0F9000");

  // The rewrites: a 4-byte command gains an Le byte 00; a 5-byte GET
  // RESPONSE keeps only the channel bits of its CLA.
  EXPECT_EQ(field(s.call("transmit " + hexByte(big) + " 11 00 08"), "response"), "6108");
  EXPECT_TRUE(card->err().waitFor("< " + hexByte(big) + " 11 00 08 00\n"));
  EXPECT_EQ(field(s.call("transmit " + hexByte(0x80 | big) + " C0 00 00 08"), "response"), "00010203040506079000");
  EXPECT_TRUE(card->err().waitFor("< " + hexByte(big) + " C0 00 00 08\n"));

  EXPECT_EQ(field(s.call("close " + std::to_string(echoCh)), "status"), "SUCCESS");
  EXPECT_EQ(field(s.call("close " + std::to_string(big)), "status"), "SUCCESS");
  EXPECT_TRUE(card->err().waitFor("< " + hexByte(big) + " 70 80 " + hexByte(big)));

  // P2 7F reaches the card as 00 on a logical channel.
  open = s.call(std::string("open ") + kP2Aid + " 0x7F");
  EXPECT_EQ(field(open, "status"), "SUCCESS");
  const int p2 = channelOf(open);
  EXPECT_EQ(field(s.call("transmit " + hexByte(p2) + " 20 00 00 00"), "response"), "009000");
  EXPECT_EQ(field(s.call("close " + std::to_string(p2)), "status"), "SUCCESS");

  const std::string basic = s.call(std::string("basic ") + kEchoAid);
  EXPECT_EQ(field(basic, "status"), "SUCCESS");
  EXPECT_EQ(field(basic, "select"), std::string("6F088406") + kEchoAid + "9000");
  EXPECT_EQ(field(s.call("transmit 00 01 00 00 02 12 34"), "response"), "12349000");

  open = s.call(std::string("open ") + kMissingAid);
  EXPECT_EQ(field(open, "status"), "NO_SUCH_ELEMENT_ERROR");
  EXPECT_EQ(field(open, "select"), "6A82");
  EXPECT_EQ(field(s.call(std::string("basic ") + kMissingAid), "status"), "NO_SUCH_ELEMENT_ERROR");

  // The card has channels 1 to 3: a fourth is refused.
  for (int i = 0; i < 3; ++i) ASSERT_GE(openEcho(s), 1);
  open = s.call(std::string("open ") + kEchoAid);
  EXPECT_EQ(field(open, "status"), "CHANNEL_NOT_AVAILABLE") << open;
  EXPECT_EQ(field(open, "channel"), "255");

  s.process().closeStdin();
  EXPECT_EQ(s.process().waitExit(), 0);
}

// secli --chain fetches what the card leaves behind 61 xx and answers 6C xx.
TEST_F(PcscEndToEnd, ChainedExchanges) {
  ASSERT_NO_FATAL_FAILURE(start());
  std::string pattern;
  for (int i = 0; i < 0x20; ++i) pattern += hexByte(i);
  SecliSession s(root, "eSE1", {"--chain", "--trace"});
  ASSERT_EQ(field(s.call("init"), "state"), "true");
  const std::string open = s.call(std::string("open ") + kBigAid);
  ASSERT_EQ(field(open, "status"), "SUCCESS") << open;
  const std::string cla = hexByte(channelOf(open));
  const std::string big = s.call("transmit " + cla + " 11 00 20 00");
  EXPECT_EQ(field(big, "response"), pattern + "9000");
  EXPECT_EQ(field(big, "exchanges"), "2");
  const int e = openEcho(s);
  const std::string fixed = s.call("transmit " + hexByte(e) + " 01 00 00 02 AB CD 05");
  EXPECT_EQ(field(fixed, "response"), "ABCD9000");
  EXPECT_EQ(field(fixed, "exchanges"), "2");
  EXPECT_TRUE(s.process().err().waitFor("secli: trace < 6C 02"));
}

// A killed client: the daemon closes the eSE, which powers the card down,
// so its channels are gone; the next client's init connects again.
TEST_F(PcscEndToEnd, AKilledClientsChannelsGoWithThePowerDown) {
  ASSERT_NO_FATAL_FAILURE(start());
  int ch = -1;
  size_t mark = 0;
  {
    SecliSession s(root, "eSE1");
    ASSERT_EQ(field(s.call("init"), "state"), "true");
    ch = openEcho(s);
    ASSERT_GE(ch, 1);
    ASSERT_EQ(echo(s, ch, "5A"), "5A9000");
    mark = card->err().size();
    s.process().stop(SIGKILL);
  }
  EXPECT_TRUE(daemon->err().waitFor("qvese@1.0-service: serviceDied enter!"));
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_close: disconnected from"));
  EXPECT_TRUE(card->err().waitFor("# power off", mark)) << card->err().text();

  SecliSession s(root, "eSE1");
  EXPECT_EQ(field(s.call("init"), "state"), "true");
  EXPECT_EQ(echo(s, ch, "11"), "6881") << "the killed client's channel is gone with the power-down";
  const int again = openEcho(s);
  EXPECT_EQ(again, ch) << "the card gives out the same channel again";
  EXPECT_EQ(echo(s, again, "22"), "229000");
}

// The card pulled out mid-session: failures, no hang; put back, the next
// init connects again.
TEST_F(PcscEndToEnd, ACardPulledOutAndPutBack) {
  ASSERT_NO_FATAL_FAILURE(start());
  SecliSession s(root, "eSE1");
  ASSERT_EQ(field(s.call("init"), "state"), "true");
  const int ch = openEcho(s);
  ASSERT_GE(ch, 1);
  env.removeCard(card);

  EXPECT_EQ(echo(s, ch, "33"), "1F");
  EXPECT_TRUE(daemon->err().waitFor("SCardTransmit on \"" + env.reader()));
  std::string open = s.call(std::string("open ") + kEchoAid);
  EXPECT_EQ(field(open, "status"), "IOERROR") << open;
  EXPECT_EQ(field(open, "channel"), "127");
  EXPECT_EQ(field(s.call("close " + std::to_string(ch)), "status"), "FAILED");
  EXPECT_TRUE(daemon->running());

  card = env.startCard();
  EXPECT_EQ(field(s.call("init"), "state"), "true");
  const int again = openEcho(s);
  ASSERT_GE(again, 1);
  EXPECT_EQ(echo(s, again, "44"), "449000");
}

// Without pcscd the eSE cannot open; the daemon says why and serves on.
TEST_F(PcscEndToEnd, WithoutPcscdInitFailsAndSaysWhy) {
  ASSERT_NO_FATAL_FAILURE(start({"PCSCLITE_CSOCK_NAME=" + root.at("no-pcscd.comm")}));
  SecliSession s(root, "eSE1");
  const size_t mark = daemon->err().size();
  s.send("init");
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_init_open: no pcscd (SCardEstablishContext: ", mark));
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_init_open FAIL", mark));
  s.process().stop(SIGKILL);
  EXPECT_TRUE(daemon->running());
  SecliSession sim(root, "SIM1");
  EXPECT_EQ(field(sim.call("present"), "present"), "false");
}

}  // namespace

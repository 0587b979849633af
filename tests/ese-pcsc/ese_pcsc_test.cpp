// The PC/SC vendor library called in-process, as the daemon calls it, with
// a real pcscd, vpcd and card-vpcd behind it. card-vpcd's trace ("< " what
// the card received) shows the bytes on the wire.
#include <gtest/gtest.h>

#include <cstring>
#include <host/log_capture.h>
#include <string>
#include <vector>

#include "../platform/test_root.h"
#include "ese_qv_hal.h"
#include "pcsc_env.h"

using Bytes = std::vector<uint8_t>;

namespace {

using android::host::LogCapture;
using se_test::PcscEnv;
using se_test::Process;

std::string hex(const Bytes& b) {
  std::string s;
  for (uint8_t x : b) s += se_test::hexByte(x);
  return s;
}
Bytes bytes(const std::string& h) {
  Bytes b;
  for (size_t i = 0; i + 1 < h.size(); i += 2) b.push_back(static_cast<uint8_t>(std::stoul(h.substr(i, 2), nullptr, 16)));
  return b;
}

// The IPC route with a 270-byte buffer, as the daemon gives it; the answer
// as hex, or "rc=N" on failure.
std::string ipc(const std::string& command) {
  Bytes c = bytes(command);
  phQvEse_data in{static_cast<uint32_t>(c.size()), c.data()};
  uint8_t buf[270 + 16];
  memset(buf, 0xEE, sizeof(buf));
  phQvEse_data rsp{0, buf};
  const int32_t rc = phQVNciHal_Transmit_APDU_by_IPC(&in, &rsp);
  for (size_t i = 270; i < sizeof(buf); ++i) EXPECT_EQ(buf[i], 0xEE) << "written past the 270-byte buffer";
  if (rc != 0) return "rc=" + std::to_string(rc) + " len=" + std::to_string(rsp.len);
  return hex(Bytes(buf, buf + std::min<uint32_t>(rsp.len, 270)));
}

struct Rpdu {
  int32_t rc;
  std::string data;  // hex
  std::string sw;
};

// Transceive into a 256-byte buffer followed by a guard area.
Rpdu transceive(phQvEse_7816_cpdu c, const Bytes& data = {}) {
  Bytes d = data;
  c.lc = c.lc ? c.lc : static_cast<uint16_t>(d.size());
  c.pdata = d.empty() ? nullptr : d.data();
  uint8_t buf[256 + 16];
  memset(buf, 0xEE, sizeof(buf));
  phQvEse_7816_rpdu r{};
  r.pdata = buf;
  r.len = c.le_type ? 2 : 0;
  Rpdu out;
  out.rc = phQvEse_7816_Transceive(&c, &r);
  for (size_t i = 256; i < sizeof(buf); ++i) EXPECT_EQ(buf[i], 0xEE) << "written past the 256-byte buffer";
  out.data = hex(Bytes(buf, buf + std::min<uint16_t>(r.len, 256)));
  out.sw = hex({r.sw1, r.sw2});
  return out;
}

phQvEse_7816_cpdu cpdu(uint8_t cla, uint8_t ins, uint8_t p1, uint8_t p2, uint8_t leType, uint32_t le) {
  return phQvEse_7816_cpdu{cla, ins, p1, p2, 0, 0, nullptr, leType, le};
}

const Bytes kEcho = {0xA0, 0x00, 0x00, 0x00, 0x01, 0x01};

class EsePcscTest : public ::testing::Test {
 protected:
  void SetUp() override {
    SE_SKIP_WITHOUT_PCSCD();
    ASSERT_NO_FATAL_FAILURE(env.start());
    setProp("vendor.ese_pcsc.reader", env.reader());
  }
  void TearDown() override {
    phQvEse_close();
    if (HasFailure()) {
      for (const auto& r : log.records()) fprintf(stderr, "log: %s\n", r.text.c_str());
      if (card) fprintf(stderr, "---- card-vpcd ----\n%s", card->err().text().c_str());
    }
  }
  void setProp(const std::string& name, const std::string& value) {
    root.appendFile("properties", name + "=" + value + "\n");
  }
  void insertCard(const std::vector<std::string>& extra = {}) { card = env.startCard(extra); }
  // The card's trace from `from` on.
  std::string wire(size_t from = 0) { return card->err().text().substr(from); }

  se_test::TestRoot root;
  LogCapture log;
  PcscEnv env;
  std::unique_ptr<Process> card;
};

TEST(EsePcscType, FromPropertyReadAtEachCall) {
  se_test::TestRoot root;
  LogCapture log;
  struct Row {
    const char* line;  // appended to the properties; the last one wins
    int32_t type;
  };
  const Row rows[] = {{"", 1}, {"vendor.ese_pcsc.type=2", 2}, {"vendor.ese_pcsc.type=0", 0},
                      {"vendor.ese_pcsc.type=two", 1}, {"vendor.ese_sim.type=0", 1}};
  for (const Row& r : rows) {
    if (*r.line) root.appendFile("properties", std::string(r.line) + "\n");
    EXPECT_EQ(get_korva_exist_flag(), r.type) << r.line;
  }
  EXPECT_TRUE(log.contains("vendor.ese_pcsc.type=\"two\" is not a number"));
}

TEST(EsePcscClosed, NothingGoesOutBeforeInit) {
  se_test::TestRoot root;
  LogCapture log;
  EXPECT_EQ(ipc("00A4040000"), "rc=-1 len=0");
  const Rpdu r = transceive(cpdu(0x00, 0xA4, 0x04, 0x00, 1, 256), kEcho);
  EXPECT_EQ(r.rc, -1);
  EXPECT_EQ(r.sw, "0000");
  EXPECT_NE(phQVNciHal_Set_KORVA_READY(), 0);
  EXPECT_NE(phQVNciHal_Get_KORVA_Ready_Status(), 0);
  EXPECT_EQ(phQvEse_close(), 0);
  EXPECT_TRUE(log.contains("not connected to a card"));
}

// init fails with a line naming why; with the card in it connects.
TEST_F(EsePcscTest, InitNamesWhyItCannotConnect) {
  EXPECT_EQ(phQvEse_init_open(), -1);
  EXPECT_TRUE(log.contains("no card in the reader matching \"" + env.reader() + "\"")) << "no card-vpcd yet";

  ASSERT_NO_FATAL_FAILURE(insertCard());
  setProp("vendor.ese_pcsc.reader", "No Such Reader");
  EXPECT_EQ(phQvEse_init_open(), -1);
  EXPECT_TRUE(log.contains("no reader matching \"No Such Reader\" (readers: \"" + env.reader()));

  // Unset: the first reader that holds a card.
  setProp("vendor.ese_pcsc.reader", "");
  EXPECT_EQ(phQvEse_init_open(), 0);
  EXPECT_TRUE(log.contains("connected to \"" + env.reader() + "\""));
  EXPECT_EQ(phQVNciHal_Set_KORVA_READY(), 0);
  EXPECT_EQ(phQVNciHal_Get_KORVA_Ready_Status(), 0);
  // A second init keeps the live connection (and the card's channels).
  const size_t mark = card->err().size();
  EXPECT_EQ(phQvEse_init_open(), 0);
  EXPECT_TRUE(log.contains("still connected to"));
  EXPECT_EQ(wire(mark).find("# power"), std::string::npos) << wire(mark);
}

// T=0 or T=1, whichever the card offers; a T=0 card's 61 xx and 6C xx come
// back as they are, for the caller to fetch.
TEST_F(EsePcscTest, ProtocolAsTheCardOffersWithStatusWordsPassedThrough) {
  struct Row {
    const char* atr;
    const char* protocol;
  };
  for (const Row& r : {Row{"3B00", "T=0"}, Row{"3B800181", "T=1"}}) {
    SCOPED_TRACE(r.atr);
    insertCard({"--atr", r.atr});
    log.clear();
    ASSERT_EQ(phQvEse_init_open(), 0);
    EXPECT_TRUE(log.contains(std::string(r.protocol) + ", ATR " + r.atr));
    EXPECT_EQ(ipc("0070000001"), "019000");
    EXPECT_EQ(ipc("01A4040006A00000000102"), "611C");
    EXPECT_EQ(ipc("0111002000"), "6120");
    EXPECT_EQ(ipc("01C0000010"), "000102030405060708090A0B0C0D0E0F6110");
    EXPECT_EQ(ipc("01A4040006A0000000010100").substr(0, 4), "6F08");
    EXPECT_EQ(ipc("0101000002ABCD05"), "6C02");
    EXPECT_EQ(phQvEse_close(), 0);
    env.removeCard(card);
  }
}

TEST_F(EsePcscTest, TransceiveSendsTheApduItsRecordDescribes) {
  ASSERT_NO_FATAL_FAILURE(insertCard());
  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(ipc("0070000001"), "019000");
  struct Row {
    const char* what;
    phQvEse_7816_cpdu c;
    Bytes data;
    const char* onWire;  // "" : refused, nothing sent
    int32_t rc;
    const char* respData;
    const char* sw;
  };
  const Row rows[] = {
      {"SELECT on channel 1, Le 256 as 00", cpdu(0x01, 0xA4, 0x04, 0x00, 1, 256), kEcho,
       "< 01 A4 04 00 06 A0 00 00 00 01 01 00", 0, "6F088406A00000000101", "9000"},
      {"SELECT, P2 0C, Le 1", cpdu(0x01, 0xA4, 0x04, 0x0C, 1, 1), kEcho, "< 01 A4 04 0C 06 A0 00 00 00 01 01 01", 0,
       "", "9000"},
      {"no Lc, no Le", cpdu(0x01, 0x01, 0x00, 0x00, 0, 0x9000), {}, "< 01 01 00 00\n", 0, "", "9000"},
      {"MANAGE CHANNEL close", cpdu(0x01, 0x70, 0x80, 0x01, 0, 0x9000), {}, "< 01 70 80 01\n", 0, "", "9000"},
      {"Le 0 with Le present", cpdu(0x00, 0xCA, 0x00, 0x66, 1, 0), {}, "", -1, "", "0000"},
      {"Le above 256", cpdu(0x00, 0xCA, 0x00, 0x66, 1, 257), {}, "", -1, "", "0000"},
  };
  for (const Row& r : rows) {
    const size_t mark = card->err().size();
    const Rpdu got = transceive(r.c, r.data);
    EXPECT_EQ(got.rc, r.rc) << r.what;
    EXPECT_EQ(got.data, r.respData) << r.what;
    EXPECT_EQ(got.sw, r.sw) << r.what;
    if (*r.onWire) {
      EXPECT_TRUE(card->err().waitFor(r.onWire, mark)) << r.what << "\n" << wire(mark);
    } else {
      EXPECT_EQ(wire(mark).find("< "), std::string::npos) << r.what << "\n" << wire(mark);
    }
  }
  // Lc 256 cannot be a short APDU.
  phQvEse_7816_cpdu big = cpdu(0x00, 0x01, 0x00, 0x00, 0, 0);
  big.lc = 256;
  EXPECT_EQ(transceive(big, Bytes(256, 0x11)).rc, -1);
}

// Full responses fill the caller's buffers to their last byte and no further.
TEST_F(EsePcscTest, ResponsesFillTheBuffersToTheEdge) {
  ASSERT_NO_FATAL_FAILURE(insertCard());
  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(ipc("0070000001"), "019000");
  ASSERT_EQ(ipc("01A4040006A0000000010200").substr(0, 2), "61");
  std::string pattern;
  for (int i = 0; i < 256; ++i) pattern += hex({static_cast<uint8_t>(i)});
  EXPECT_EQ(ipc("0110010000"), pattern + "9000");
  const Rpdu r = transceive(cpdu(0x01, 0x10, 0x01, 0x00, 1, 256));
  EXPECT_EQ(r.rc, 0);
  EXPECT_EQ(r.data, pattern);
  EXPECT_EQ(r.sw, "9000");

  // INS 12 answers N bytes at once, as a card with extended lengths: the
  // most each route holds comes back whole, one byte more is refused.
  struct Row {
    bool ipc;
    uint16_t n;  // data bytes the card answers, SW1 SW2 after them
    bool fits;
  };
  for (const Row& row : {Row{true, 268, true}, Row{true, 269, false}, Row{false, 256, true}, Row{false, 257, false}}) {
    SCOPED_TRACE(std::string(row.ipc ? "IPC " : "Transceive ") + std::to_string(row.n));
    std::string want;
    for (int i = 0; i < row.n; ++i) want += hex({static_cast<uint8_t>(i)});
    const uint8_t p1 = static_cast<uint8_t>(row.n >> 8), p2 = static_cast<uint8_t>(row.n & 0xFF);
    if (row.ipc) {
      EXPECT_EQ(ipc("0112" + hex({p1, p2})), row.fits ? want + "9000" : "rc=-1 len=0");
    } else {
      const Rpdu t = transceive(cpdu(0x01, 0x12, p1, p2, 0, 0));
      EXPECT_EQ(t.rc, row.fits ? 0 : -1);
      EXPECT_EQ(t.data, row.fits ? want : "");
    }
  }
}

// Fewer bytes than an APDU header are refused, never sent: vpcd would take
// one byte for a power command and wait for an answer to none forever.
TEST_F(EsePcscTest, CommandsShorterThanAHeaderAreNotSent) {
  ASSERT_NO_FATAL_FAILURE(insertCard());
  ASSERT_EQ(phQvEse_init_open(), 0);
  const size_t mark = card->err().size();
  for (const char* c : {"", "00", "00A404"}) EXPECT_EQ(ipc(c), "rc=-1 len=0") << c;
  EXPECT_EQ(wire(mark).find("<"), std::string::npos) << wire(mark);
  EXPECT_EQ(wire(mark).find("# power"), std::string::npos) << wire(mark);
  EXPECT_EQ(ipc("00A4040000").substr(0, 2), "6F");
}

// Close powers the card down: every logical channel is gone. The power-off
// the daemon asks after each channel close leaves them be.
TEST_F(EsePcscTest, OnlyCloseDropsTheChannels) {
  ASSERT_NO_FATAL_FAILURE(insertCard());
  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(ipc("0070000001"), "019000");
  ASSERT_EQ(ipc("01A4040006A0000000010100").substr(0, 4), "6F08");
  size_t mark = card->err().size();
  EXPECT_EQ(phQVNciHal_Set_KORVA_Power("korva_poweroff"), 0);
  EXPECT_EQ(ipc("0101000001AA"), "AA9000");
  EXPECT_EQ(wire(mark).find("# power"), std::string::npos) << wire(mark);

  mark = card->err().size();
  EXPECT_EQ(phQvEse_close(), 0);
  EXPECT_NE(phQVNciHal_Get_KORVA_Ready_Status(), 0);
  EXPECT_EQ(ipc("0101000001AA"), "rc=-1 len=0");
  // Connected again at once: the close itself powered the card down, not
  // pcscd's own power-off of an idle card some time later.
  ASSERT_EQ(phQvEse_init_open(), 0);
  EXPECT_EQ(ipc("0101000001AA"), "6881");
  EXPECT_TRUE(card->err().waitFor("# power off", mark));
}

// pcscd gone (as a reader unplugged) and back: failures, then a new
// connection. The card stays in vpcd's reader and meets the new pcscd.
TEST_F(EsePcscTest, PcscdGoneAndBack) {
  if (!env.ours()) GTEST_SKIP() << "needs a pcscd of the test's own; a pcscd not started by the tests is running";
  ASSERT_NO_FATAL_FAILURE(insertCard());
  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(ipc("0070000001"), "019000");
  ASSERT_NO_FATAL_FAILURE(env.stopDaemon());
  log.clear();
  EXPECT_EQ(ipc("0101000001AA"), "rc=-1 len=0");
  EXPECT_TRUE(log.contains(pcsc_stringify_error(SCARD_E_NO_SERVICE))) << "the error is named";
  EXPECT_EQ(phQvEse_init_open(), -1);
  EXPECT_TRUE(log.contains("no pcscd"));

  ASSERT_NO_FATAL_FAILURE(env.restartDaemon());
  ASSERT_TRUE(env.waitCard(true)) << card->err().text();
  ASSERT_EQ(phQvEse_init_open(), 0);
  EXPECT_EQ(ipc("0070000001"), "019000");
}

}  // namespace

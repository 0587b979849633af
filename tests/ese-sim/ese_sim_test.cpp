// The simulated vendor library called in-process, as the daemon calls it.
#include <gtest/gtest.h>

#include <stdlib.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "../platform/test_root.h"
#include "card_applets.h"
#include "ese_qv_hal.h"

using Bytes = std::vector<uint8_t>;

namespace {

// What an exchange gave: whether it succeeded, and the bytes (IPC: the
// response; Transceive: the data, then SW1 SW2 from the record).
using Reply = std::pair<bool, Bytes>;
Reply ok(Bytes b) { return {true, std::move(b)}; }
Reply failed(Bytes b = {}) { return {false, std::move(b)}; }

const Bytes kManageOpen = {0x00, 0x70, 0x00, 0x00, 0x01};
const Bytes kGetData1 = {0x01, 0xCA, 0x00, 0x66, 0x00};  // on channel 1

// The IPC route with a 270-byte buffer, as the daemon gives it.
Reply ipc(Bytes cmd) {
  phQvEse_data in{static_cast<uint32_t>(cmd.size()), cmd.empty() ? nullptr : cmd.data()};
  uint8_t buf[270] = {};
  phQvEse_data rsp{0, buf};
  const int32_t rc = phQVNciHal_Transmit_APDU_by_IPC(&in, &rsp);
  EXPECT_LE(rsp.len, 258u);
  return {rc == 0, Bytes(buf, buf + std::min<uint32_t>(rsp.len, 270))};
}

// Transceive into a 256-byte buffer followed by a guard area that must stay
// untouched. `le` 0: no Le.
Reply trx(Bytes head, Bytes data, uint32_t le = 256) {
  phQvEse_7816_cpdu c{head[0], head[1], head[2], head[3], static_cast<uint16_t>(data.size()), 0,
                      data.empty() ? nullptr : data.data(), static_cast<uint8_t>(le ? 1 : 0),
                      le ? le : 0x9000};
  uint8_t buf[256 + 32];
  memset(buf, 0xEE, sizeof(buf));
  phQvEse_7816_rpdu r{};
  r.pdata = buf;
  r.len = le ? 2 : 0;
  const int32_t rc = phQvEse_7816_Transceive(&c, &r);
  for (size_t i = 256; i < sizeof(buf); ++i) EXPECT_EQ(buf[i], 0xEE) << "written past 256 bytes";
  Bytes out(buf, buf + std::min<uint16_t>(r.len, 256));
  out.insert(out.end(), {r.sw1, r.sw2});
  return {rc == 0, out};
}

class EseSimTest : public ::testing::Test {
 protected:
  void SetUp() override { phQvEse_close(); }  // a closed eSE and a fresh card
  void TearDown() override { phQvEse_close(); }
  // Scripts change a property by appending a line; the last one wins.
  void setProp(const std::string& name, const std::string& value) {
    root_.appendFile("properties", "vendor.ese_sim." + name + "=" + value + "\n");
  }
  se_test::TestRoot root_;
};

TEST_F(EseSimTest, TypeFromPropertyReadAtEachCall) {
  EXPECT_EQ(get_korva_exist_flag(), 1);
  for (const char* v : {"2", "0", "3", "-1"}) {
    setProp("type", v);
    EXPECT_EQ(get_korva_exist_flag(), atoi(v));
  }
  setProp("type", "two");
  EXPECT_EQ(get_korva_exist_flag(), 1);
}

TEST_F(EseSimTest, ExchangesFailUntilOpenedAndAfterCloseWhichPowerCyclesTheCard) {
  EXPECT_EQ(ipc(kManageOpen), failed());
  EXPECT_FALSE(trx({0x00, 0xA4, 0x04, 0x00}, {}).first);
  ASSERT_EQ(phQvEse_init_open(), 0);
  EXPECT_EQ(ipc(kManageOpen), ok({0x01, 0x90, 0x00}));
  ASSERT_EQ(phQvEse_init_open(), 0);  // a second open keeps the card as it is
  EXPECT_EQ(ipc(kGetData1).second.size(), 10u);
  phQvEse_close();
  EXPECT_EQ(ipc(kGetData1), failed());
  ASSERT_EQ(phQvEse_init_open(), 0);
  EXPECT_EQ(ipc(kGetData1), ok({0x68, 0x81}));  // channel 1 is gone
}

TEST_F(EseSimTest, FaultSwitchesActAtRunTime) {
  EXPECT_EQ(phQVNciHal_Set_KORVA_READY(), 0);
  EXPECT_EQ(phQVNciHal_Get_KORVA_Ready_Status(), 0);
  setProp("fail_ready", "1");
  setProp("ready_status", "5");
  EXPECT_NE(phQVNciHal_Set_KORVA_READY(), 0);
  EXPECT_EQ(phQVNciHal_Get_KORVA_Ready_Status(), 5);
  setProp("fail_ready", "0");
  EXPECT_EQ(phQVNciHal_Set_KORVA_READY(), 0);

  setProp("fail_open", "true");
  EXPECT_NE(phQvEse_init_open(), 0);
  setProp("fail_open", "0");
  ASSERT_EQ(phQvEse_init_open(), 0);

  // A plain failure leaves no status; a status word given is left in both.
  setProp("fail_exchange", "1");
  EXPECT_EQ(ipc(kManageOpen), failed());
  EXPECT_EQ(trx({0x00, 0xA4, 0x04, 0x00}, se_card::aid::kEcho), failed({0x00, 0x00}));
  setProp("fail_exchange", "6a82");
  EXPECT_EQ(ipc(kManageOpen), failed({0x6A, 0x82}));
  EXPECT_EQ(trx({0x00, 0xA4, 0x04, 0x00}, se_card::aid::kEcho), failed({0x6A, 0x82}));
  setProp("fail_exchange", "0");
  EXPECT_EQ(ipc(kManageOpen), ok({0x01, 0x90, 0x00}));
  // The power-off request leaves open channels alone.
  EXPECT_EQ(phQVNciHal_Set_KORVA_Power("korva_poweroff"), 0);
  EXPECT_EQ(ipc(kGetData1).second.size(), 10u);
}

// The daemon's logical-channel sequence: MANAGE CHANNEL open over IPC, SELECT
// by Transceive, GET RESPONSE over IPC, MANAGE CHANNEL close by Transceive.
TEST_F(EseSimTest, LogicalChannelSequenceAsTheDaemonSendsIt) {
  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(ipc(kManageOpen), ok({0x01, 0x90, 0x00}));
  Reply sel = trx({0x01, 0xA4, 0x04, 0x00}, se_card::aid::kBig);
  ASSERT_EQ(sel.second.size(), 2u);  // no data, 61 xx
  EXPECT_EQ(sel.second[0], 0x61);
  Reply fci = ipc({0x01, 0xC0, 0x00, 0x00, sel.second[1]});
  ASSERT_EQ(fci.second.size(), sel.second[1] + 2u);
  EXPECT_EQ(fci.second[0], 0x6F);

  sel = trx({0x01, 0xA4, 0x04, 0x00}, se_card::aid::kEcho);
  EXPECT_EQ(sel.second.front(), 0x6F);
  EXPECT_EQ(Bytes(sel.second.end() - 2, sel.second.end()), (Bytes{0x90, 0x00}));
  EXPECT_EQ(ipc({0x01, 0x01, 0x00, 0x00, 0x02, 0xCA, 0xFE}), ok({0xCA, 0xFE, 0x90, 0x00}));
  EXPECT_EQ(trx({0x01, 0x01, 0x00, 0x00}, {0xCA, 0xFE}, 5), ok({0x6C, 0x02}));  // Le reaches the card
  EXPECT_EQ(trx({0x01, 0x70, 0x80, 0x01}, {}, 0), ok({0x90, 0x00}));
  EXPECT_EQ(trx({0x01, 0x70, 0x80, 0x01}, {}, 0), ok({0x68, 0x81}));  // already closed

  // Four channels by default (basic + 3), like the daemon's table.
  for (uint8_t expect = 1; expect <= 3; ++expect) EXPECT_EQ(ipc(kManageOpen), ok({expect, 0x90, 0x00}));
  EXPECT_EQ(ipc(kManageOpen), ok({0x6A, 0x81}));
}

TEST_F(EseSimTest, ChannelCountPropertyTakenWhenOpenedFromClosed) {
  setProp("channels", "20");
  ASSERT_EQ(phQvEse_init_open(), 0);
  for (int i = 0; i < 3; ++i) ASSERT_TRUE(ipc(kManageOpen).first);
  EXPECT_EQ(ipc(kManageOpen), ok({0x04, 0x90, 0x00}));
  EXPECT_EQ(ipc({0x40, 0xCA, 0x00, 0x66, 0x00}).second.size(), 10u);  // channel 4 through CLA 0x40
}

TEST_F(EseSimTest, ResponsesStayWithinTheCallersBuffers) {
  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(trx({0x00, 0xA4, 0x04, 0x00}, se_card::aid::kBig).second[0], 0x61);
  // 256 data bytes exactly fill the basic channel's SELECT-sized buffer;
  // more than one response holds comes as 61 00 with no data.
  Reply t = trx({0x00, 0x10, 0x01, 0x00}, {});
  ASSERT_TRUE(t.first);
  ASSERT_EQ(t.second.size(), 258u);
  EXPECT_EQ(t.second[255], 0xFF);
  EXPECT_EQ(trx({0x00, 0x10, 0x01, 0x2C}, {}), ok({0x61, 0x00}));
  // Over IPC: 256 data bytes and SW, never more than 258.
  Reply r = ipc({0x00, 0xC0, 0x00, 0x00, 0x00});
  ASSERT_EQ(r.second.size(), 258u);
  EXPECT_EQ(Bytes(r.second.end() - 2, r.second.end()), (Bytes{0x61, 0x2C}));
  EXPECT_EQ(ipc({0x00, 0xC0, 0x00, 0x00, 0x2C}).second.size(), 0x2Cu + 2);
  // A command longer than any short APDU, and an empty one.
  EXPECT_EQ(ipc(Bytes(5000, 0x00)), ok({0x67, 0x00}));
  EXPECT_EQ(ipc({}), ok({0x67, 0x00}));

  // At the edge, with INS 12 answering N bytes at once: 256 data bytes come
  // back whole on both routes, one more is refused with nothing handed back.
  for (const uint16_t n : {256, 257}) {
    SCOPED_TRACE(n);
    Bytes want(n);
    for (size_t i = 0; i < n; ++i) want[i] = static_cast<uint8_t>(i);
    want.insert(want.end(), {0x90, 0x00});
    const Bytes cmd = {0x00, 0x12, static_cast<uint8_t>(n >> 8), static_cast<uint8_t>(n & 0xFF)};
    EXPECT_EQ(ipc(cmd), n <= 256 ? ok(want) : failed());
    EXPECT_EQ(trx(cmd, {}, 0), n <= 256 ? ok(want) : failed({0x00, 0x00}));
  }
}

TEST_F(EseSimTest, MalformedRecordsAreRefused) {
  ASSERT_EQ(phQvEse_init_open(), 0);
  EXPECT_NE(phQvEse_7816_Transceive(nullptr, nullptr), 0);
  EXPECT_NE(phQVNciHal_Transmit_APDU_by_IPC(nullptr, nullptr), 0);
  EXPECT_NE(phQVNciHal_Set_KORVA_Power(nullptr), 0);
  struct Row {
    const char* what;
    uint16_t lc;
    uint32_t le;
    bool buffer;
  };
  const Row rows[] = {{"Lc without data", 6, 0, true},
                      {"no such Le", 0, 300, true},
                      {"data but no buffer for it", 0, 256, false}};
  for (const Row& row : rows) {
    uint8_t buf[256];
    phQvEse_7816_cpdu c{0x00, 0xA4, 0x04, 0x00, row.lc, 0, nullptr,
                        static_cast<uint8_t>(row.le ? 1 : 0), row.le};
    phQvEse_7816_rpdu r{};
    r.pdata = row.buffer ? buf : nullptr;
    EXPECT_NE(phQvEse_7816_Transceive(&c, &r), 0) << row.what;
    EXPECT_EQ(r.len, 0) << row.what;
  }
  uint8_t cmd[5] = {0x00, 0x70, 0x00, 0x00, 0x01};
  phQvEse_data in{5, cmd};
  phQvEse_data out{0, nullptr};
  EXPECT_NE(phQVNciHal_Transmit_APDU_by_IPC(&in, &out), 0);
  EXPECT_EQ(out.len, 0u);
}

// Standard error, where the library logs, goes to a file while this lives.
class StderrToFile {
 public:
  explicit StderrToFile(std::string path) : path_(std::move(path)), saved_(dup(STDERR_FILENO)) {
    fflush(stderr);
    FILE* f = fopen(path_.c_str(), "w");
    if (f != nullptr) {
      dup2(fileno(f), STDERR_FILENO);
      fclose(f);
    }
  }
  ~StderrToFile() {
    fflush(stderr);
    dup2(saved_, STDERR_FILENO);
    close(saved_);
  }
  std::string text() const {
    std::ostringstream s;
    s << std::ifstream(path_).rdbuf();
    return s.str();
  }

 private:
  std::string path_;
  int saved_;
};

// A long but healthy command: only the P1 named is slowed, on both routes,
// and the wait is logged when it starts.
TEST_F(EseSimTest, SlowCommandByP1) {
  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(trx({0x00, 0xA4, 0x04, 0x00}, se_card::aid::kEcho).first, true);
  setProp("slow_p1", "3a");
  setProp("slow_ms", "300");
  StderrToFile err(root_.at("stderr"));
  const auto msTaken = [](auto&& exchange) {
    const auto t0 = std::chrono::steady_clock::now();
    const Reply r = exchange();
    EXPECT_EQ(r, ok({0xCA, 0xFE, 0x90, 0x00}));
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - t0).count();
  };
  EXPECT_GE(msTaken([] { return ipc({0x00, 0x01, 0x3A, 0x00, 0x02, 0xCA, 0xFE}); }), 300);
  EXPECT_GE(msTaken([] { return trx({0x00, 0x01, 0x3A, 0x00}, {0xCA, 0xFE}, 0); }), 300);
  EXPECT_LT(msTaken([] { return ipc({0x00, 0x01, 0x3B, 0x00, 0x02, 0xCA, 0xFE}); }), 300);
  setProp("slow_p1", "3x");  // not a byte: nothing is slowed
  EXPECT_LT(msTaken([] { return ipc({0x00, 0x01, 0x3A, 0x00, 0x02, 0xCA, 0xFE}); }), 300);
  const std::string log = err.text();
  EXPECT_NE(log.find("IPC: slow command (P1 3A), answering in 300 ms"), std::string::npos) << log;
  EXPECT_NE(log.find("Transceive: slow command (P1 3A), answering in 300 ms"), std::string::npos) << log;
}

// The daemon calls init and serviceDied (open, close) without its lock while
// a transmit may run: each exchange still sees either a closed eSE (no bytes)
// or a whole card answer.
TEST_F(EseSimTest, OpenAndCloseBesideExchanges) {
  ASSERT_EQ(phQvEse_init_open(), 0);
  std::thread opener([] {
    for (int i = 0; i < 200; ++i) {
      phQvEse_close();
      phQvEse_init_open();
    }
  });
  for (int i = 0; i < 400; ++i) {
    Reply r = ipc({0x00, 0xCA, 0x00, 0x66, 0x00});
    if (r.first) {
      ASSERT_EQ(r.second.size(), 10u);
      EXPECT_EQ(r.second[8], 0x90);
    } else {
      EXPECT_TRUE(r.second.empty());
    }
  }
  opener.join();
  EXPECT_EQ(phQvEse_init_open(), 0);
}

}  // namespace

// The simulated vendor library called in-process, as the daemon calls it.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include <condition_variable>
#include <cstring>
#include <fstream>
#include <functional>
#include <future>
#include <mutex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "../platform/test_root.h"
#include "card_applets.h"
#include "ese_qv_hal.h"

using Bytes = std::vector<uint8_t>;

namespace {

class EseSimTest : public ::testing::Test {
 protected:
  void SetUp() override { phQvEse_close(); }  // a closed eSE and a fresh card
  void TearDown() override { phQvEse_close(); }
  // Scripts change a property by appending a line; the last one wins.
  void setProp(const std::string& name, const std::string& value) {
    root_.appendFile("properties", name + "=" + value + "\n");
  }

  // The IPC route with a 270-byte buffer, as the daemon gives it.
  int32_t ipc(const Bytes& cmd, Bytes& out) {
    Bytes c = cmd;
    phQvEse_data in{static_cast<uint32_t>(c.size()), c.empty() ? nullptr : c.data()};
    uint8_t buf[270];
    memset(buf, 0, sizeof(buf));
    phQvEse_data rsp{0, buf};
    int32_t rc = phQVNciHal_Transmit_APDU_by_IPC(&in, &rsp);
    EXPECT_LE(rsp.len, 270u);
    out.assign(buf, buf + std::min<uint32_t>(rsp.len, 270));
    return rc;
  }

  se_test::TestRoot root_;
};

struct TransceiveResult {
  int32_t rc;
  uint8_t sw1, sw2;
  Bytes data;
  bool canaryIntact;
};

// Transceive into a 256-byte buffer followed by a guard area.
TransceiveResult transceive(uint8_t cla, uint8_t ins, uint8_t p1, uint8_t p2, Bytes data, bool le,
                            uint32_t leValue = 256) {
  phQvEse_7816_cpdu c{};
  c.cla = cla;
  c.ins = ins;
  c.p1 = p1;
  c.p2 = p2;
  c.lc = static_cast<uint16_t>(data.size());
  c.pdata = data.empty() ? nullptr : data.data();
  c.le_type = le ? 1 : 0;
  c.le = le ? leValue : 0x9000;
  uint8_t buf[256 + 32];
  memset(buf, 0xEE, sizeof(buf));
  phQvEse_7816_rpdu r{};
  r.pdata = buf;
  r.len = le ? 2 : 0;
  TransceiveResult out{};
  out.rc = phQvEse_7816_Transceive(&c, &r);
  out.sw1 = r.sw1;
  out.sw2 = r.sw2;
  out.data.assign(buf, buf + std::min<uint16_t>(r.len, 256));
  out.canaryIntact = true;
  for (size_t i = 256; i < sizeof(buf); ++i) out.canaryIntact &= buf[i] == 0xEE;
  return out;
}

TEST_F(EseSimTest, TypeFromPropertyReadAtEachCall) {
  EXPECT_EQ(get_korva_exist_flag(), 1);
  for (const char* v : {"2", "0", "3", "-1"}) {
    setProp("vendor.ese_sim.type", v);
    EXPECT_EQ(get_korva_exist_flag(), atoi(v));
  }
  setProp("vendor.ese_sim.type", "two");
  EXPECT_EQ(get_korva_exist_flag(), 1);
}

TEST_F(EseSimTest, ExchangesFailUntilOpenedAndAfterClose) {
  Bytes out;
  EXPECT_NE(ipc({0x00, 0x70, 0x00, 0x00, 0x01}, out), 0);
  EXPECT_TRUE(out.empty());
  EXPECT_NE(transceive(0x00, 0xA4, 0x04, 0x00, {}, true).rc, 0);

  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(ipc({0x00, 0x70, 0x00, 0x00, 0x01}, out), 0);
  EXPECT_EQ(out, (Bytes{0x01, 0x90, 0x00}));
  // A second open keeps the card as it is.
  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(ipc({0x01, 0xCA, 0x00, 0x66, 0x00}, out), 0);
  EXPECT_EQ(out.back(), 0x00);
  EXPECT_EQ(out[out.size() - 2], 0x90);

  phQvEse_close();
  EXPECT_NE(ipc({0x01, 0xCA, 0x00, 0x66, 0x00}, out), 0);
  // Closing power-cycled the card: channel 1 is gone.
  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(ipc({0x01, 0xCA, 0x00, 0x66, 0x00}, out), 0);
  EXPECT_EQ(out, (Bytes{0x68, 0x81}));
}

TEST_F(EseSimTest, FaultSwitchesActAtRunTime) {
  EXPECT_EQ(phQVNciHal_Set_KORVA_READY(), 0);
  EXPECT_EQ(phQVNciHal_Get_KORVA_Ready_Status(), 0);
  setProp("vendor.ese_sim.fail_ready", "1");
  setProp("vendor.ese_sim.ready_status", "5");
  EXPECT_NE(phQVNciHal_Set_KORVA_READY(), 0);
  EXPECT_EQ(phQVNciHal_Get_KORVA_Ready_Status(), 5);
  setProp("vendor.ese_sim.fail_ready", "0");
  EXPECT_EQ(phQVNciHal_Set_KORVA_READY(), 0);

  setProp("vendor.ese_sim.fail_open", "true");
  EXPECT_NE(phQvEse_init_open(), 0);
  setProp("vendor.ese_sim.fail_open", "0");
  ASSERT_EQ(phQvEse_init_open(), 0);

  Bytes out;
  setProp("vendor.ese_sim.fail_exchange", "1");
  EXPECT_NE(ipc({0x00, 0x70, 0x00, 0x00, 0x01}, out), 0);
  EXPECT_TRUE(out.empty());
  TransceiveResult t = transceive(0x00, 0xA4, 0x04, 0x00, se_card::aid::kEcho, true);
  EXPECT_NE(t.rc, 0);
  EXPECT_EQ(t.sw1, 0);
  EXPECT_EQ(t.sw2, 0);
  EXPECT_TRUE(t.data.empty());

  setProp("vendor.ese_sim.fail_exchange", "6a82");
  EXPECT_NE(ipc({0x00, 0x70, 0x00, 0x00, 0x01}, out), 0);
  EXPECT_EQ(out, (Bytes{0x6A, 0x82}));
  t = transceive(0x00, 0xA4, 0x04, 0x00, se_card::aid::kEcho, true);
  EXPECT_NE(t.rc, 0);
  EXPECT_EQ(t.sw1, 0x6A);
  EXPECT_EQ(t.sw2, 0x82);

  setProp("vendor.ese_sim.fail_exchange", "0");
  EXPECT_EQ(ipc({0x00, 0x70, 0x00, 0x00, 0x01}, out), 0);
  EXPECT_EQ(out, (Bytes{0x01, 0x90, 0x00}));
  EXPECT_EQ(phQVNciHal_Set_KORVA_Power("korva_poweroff"), 0);
  // The power-off request leaves open channels alone.
  EXPECT_EQ(ipc({0x01, 0xCA, 0x00, 0x66, 0x00}, out), 0);
  EXPECT_EQ(out[out.size() - 2], 0x90);
}

// The daemon's logical-channel sequence: MANAGE CHANNEL open over IPC, SELECT
// by Transceive, GET RESPONSE over IPC, MANAGE CHANNEL close by Transceive.
TEST_F(EseSimTest, LogicalChannelSequenceAsTheDaemonSendsIt) {
  ASSERT_EQ(phQvEse_init_open(), 0);
  Bytes out;
  ASSERT_EQ(ipc({0x00, 0x70, 0x00, 0x00, 0x01}, out), 0);
  ASSERT_EQ(out, (Bytes{0x01, 0x90, 0x00}));

  TransceiveResult sel = transceive(0x01, 0xA4, 0x04, 0x00, se_card::aid::kBig, true);
  ASSERT_EQ(sel.rc, 0);
  EXPECT_EQ(sel.sw1, 0x61);
  EXPECT_TRUE(sel.data.empty());
  ASSERT_EQ(ipc({0x01, 0xC0, 0x00, 0x00, sel.sw2}, out), 0);
  ASSERT_EQ(out.size(), sel.sw2 + 2u);
  EXPECT_EQ(out[0], 0x6F);
  EXPECT_EQ(Bytes(out.end() - 2, out.end()), (Bytes{0x90, 0x00}));

  sel = transceive(0x01, 0xA4, 0x04, 0x00, se_card::aid::kEcho, true);
  ASSERT_EQ(sel.rc, 0);
  EXPECT_EQ(sel.sw1, 0x90);
  EXPECT_EQ(sel.data[0], 0x6F);
  ASSERT_EQ(ipc({0x01, 0x01, 0x00, 0x00, 0x02, 0xCA, 0xFE}, out), 0);
  EXPECT_EQ(out, (Bytes{0xCA, 0xFE, 0x90, 0x00}));

  TransceiveResult close = transceive(0x01, 0x70, 0x80, 0x01, {}, false);
  EXPECT_EQ(close.rc, 0);
  EXPECT_EQ(close.sw1, 0x90);
  EXPECT_EQ(close.sw2, 0x00);
  EXPECT_TRUE(close.data.empty());
  EXPECT_EQ(transceive(0x01, 0x70, 0x80, 0x01, {}, false).sw1, 0x68);  // already closed

  // Four channels by default (basic + 3), like the daemon's table.
  for (uint8_t expect = 1; expect <= 3; ++expect) {
    ASSERT_EQ(ipc({0x00, 0x70, 0x00, 0x00, 0x01}, out), 0);
    EXPECT_EQ(out, (Bytes{expect, 0x90, 0x00}));
  }
  ASSERT_EQ(ipc({0x00, 0x70, 0x00, 0x00, 0x01}, out), 0);
  EXPECT_EQ(out, (Bytes{0x6A, 0x81}));
}

TEST_F(EseSimTest, ChannelCountPropertyTakenWhenOpenedFromClosed) {
  setProp("vendor.ese_sim.channels", "20");
  ASSERT_EQ(phQvEse_init_open(), 0);
  Bytes out;
  for (int i = 0; i < 4; ++i) ASSERT_EQ(ipc({0x00, 0x70, 0x00, 0x00, 0x01}, out), 0);
  EXPECT_EQ(out, (Bytes{0x04, 0x90, 0x00}));
  ASSERT_EQ(ipc({0x40, 0xCA, 0x00, 0x66, 0x00}, out), 0);  // channel 4 through CLA 0x40
  EXPECT_EQ(out[out.size() - 2], 0x90);
}

TEST_F(EseSimTest, ResponsesStayWithinTheCallersBuffers) {
  ASSERT_EQ(phQvEse_init_open(), 0);
  ASSERT_EQ(transceive(0x00, 0xA4, 0x04, 0x00, se_card::aid::kBig, true).sw1, 0x61);
  // 256 data bytes exactly fill the basic channel's SELECT-sized buffer.
  TransceiveResult t = transceive(0x00, 0x10, 0x01, 0x00, {}, true, 256);
  ASSERT_EQ(t.rc, 0);
  EXPECT_EQ(t.data.size(), 256u);
  EXPECT_EQ(t.data[255], 0xFF);
  EXPECT_TRUE(t.canaryIntact);
  // More than one response holds comes as 61 00 with no data.
  t = transceive(0x00, 0x10, 0x01, 0x2C, {}, true, 256);
  ASSERT_EQ(t.rc, 0);
  EXPECT_EQ(t.sw1, 0x61);
  EXPECT_TRUE(t.data.empty());
  EXPECT_TRUE(t.canaryIntact);

  // Over IPC: 256 data bytes and SW, never more than 258.
  Bytes out;
  ASSERT_EQ(ipc({0x00, 0xC0, 0x00, 0x00, 0x00}, out), 0);
  EXPECT_EQ(out.size(), 258u);
  EXPECT_EQ(Bytes(out.end() - 2, out.end()), (Bytes{0x61, 0x2C}));
  ASSERT_EQ(ipc({0x00, 0xC0, 0x00, 0x00, 0x2C}, out), 0);
  EXPECT_EQ(out.size(), 0x2Cu + 2);

  // A command longer than any short APDU, and an empty one.
  Bytes huge(5000, 0x00);
  ASSERT_EQ(ipc(huge, out), 0);
  EXPECT_EQ(out, (Bytes{0x67, 0x00}));
  ASSERT_EQ(ipc({}, out), 0);
  EXPECT_EQ(out, (Bytes{0x67, 0x00}));
}

TEST_F(EseSimTest, MalformedRecordsAreRefused) {
  ASSERT_EQ(phQvEse_init_open(), 0);
  EXPECT_NE(phQvEse_7816_Transceive(nullptr, nullptr), 0);
  EXPECT_NE(phQVNciHal_Transmit_APDU_by_IPC(nullptr, nullptr), 0);
  EXPECT_NE(phQVNciHal_Set_KORVA_Power(nullptr), 0);
  phQvEse_7816_cpdu c{};
  c.ins = 0xA4;
  c.p1 = 0x04;
  c.lc = 6;  // but no data
  phQvEse_7816_rpdu r{};
  EXPECT_NE(phQvEse_7816_Transceive(&c, &r), 0);
  c.lc = 0;
  c.le_type = 1;
  c.le = 300;  // no such Le
  EXPECT_NE(phQvEse_7816_Transceive(&c, &r), 0);
  // A response with data but no buffer for it.
  c.le = 256;
  r.pdata = nullptr;
  EXPECT_NE(phQvEse_7816_Transceive(&c, &r), 0);
  EXPECT_EQ(r.len, 0);
  uint8_t cmd[5] = {0x00, 0x70, 0x00, 0x00, 0x01};
  phQvEse_data in{5, cmd};
  phQvEse_data out{0, nullptr};
  EXPECT_NE(phQVNciHal_Transmit_APDU_by_IPC(&in, &out), 0);
  EXPECT_EQ(out.len, 0u);
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
    uint8_t cmd[] = {0x00, 0xCA, 0x00, 0x66, 0x00};
    uint8_t buf[270];
    memset(buf, 0, sizeof(buf));
    phQvEse_data in{sizeof(cmd), cmd};
    phQvEse_data rsp{0, buf};
    if (phQVNciHal_Transmit_APDU_by_IPC(&in, &rsp) == 0) {
      ASSERT_EQ(rsp.len, 10u);
      EXPECT_EQ(buf[8], 0x90);
    } else {
      EXPECT_EQ(rsp.len, 0u);
    }
  }
  opener.join();
  EXPECT_EQ(phQvEse_init_open(), 0);
}

// The library's log goes to standard error through its own copy of the log
// stand-in; while a tap lives, standard error runs into a pipe that the test
// reads, so it can wait for a line the library writes.
class StderrTap {
 public:
  StderrTap() {
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0) abort();
    saved_ = dup(2);
    dup2(fds[1], 2);
    close(fds[1]);
    readFd_ = fds[0];
    reader_ = std::thread([this] {
      char buf[1024];
      ssize_t n;
      while ((n = read(readFd_, buf, sizeof(buf))) > 0) {
        std::lock_guard<std::mutex> l(mu_);
        text_.append(buf, static_cast<size_t>(n));
        cv_.notify_all();
      }
    });
  }
  ~StderrTap() {
    dup2(saved_, 2);  // the pipe's last writer goes: the reader ends
    close(saved_);
    reader_.join();
    close(readFd_);
  }
  bool waitFor(const std::string& needle) {
    std::unique_lock<std::mutex> l(mu_);
    return cv_.wait_for(l, std::chrono::seconds(20),
                        [&] { return text_.find(needle) != std::string::npos; });
  }

 private:
  int saved_ = -1;
  int readFd_ = -1;
  std::mutex mu_;
  std::condition_variable cv_;
  std::string text_;
  std::thread reader_;
};

class EseSimSwitches : public EseSimTest {
 protected:
  std::string report() {
    std::ifstream in(root_.at("data/vendor/ese_sim/open_channels"));
    if (!in) return "(no report)";
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
  }
  Bytes manageOpen() {
    Bytes out;
    EXPECT_EQ(ipc({0x00, 0x70, 0x00, 0x00, 0x01}, out), 0);
    return out;
  }
};

// Channels handed out from a chosen number on, and the report of what is open
// after each change, the closes from the basic channel included.
TEST_F(EseSimSwitches, MinimumChannelAndOpenChannelReport) {
  setProp("vendor.ese_sim.channels", "8");
  setProp("vendor.ese_sim.min_channel", "4");
  ASSERT_EQ(phQvEse_init_open(), 0);
  EXPECT_EQ(report(), "\n");
  EXPECT_EQ(manageOpen(), (Bytes{0x04, 0x90, 0x00}));
  EXPECT_EQ(report(), "4\n");
  EXPECT_EQ(manageOpen(), (Bytes{0x05, 0x90, 0x00}));
  EXPECT_EQ(report(), "4 5\n");
  // The new channel answers through its further-interindustry CLA.
  Bytes out;
  ASSERT_EQ(ipc({0x41, 0xCA, 0x00, 0x66, 0x00}, out), 0);
  EXPECT_EQ(out[out.size() - 2], 0x90);

  const TransceiveResult closed = transceive(0x00, 0x70, 0x80, 0x04, {}, false);
  EXPECT_EQ(closed.rc, 0);
  EXPECT_EQ(closed.sw1, 0x90);
  EXPECT_EQ(report(), "5\n");

  setProp("vendor.ese_sim.min_channel", "7");
  EXPECT_EQ(manageOpen(), (Bytes{0x07, 0x90, 0x00}));
  EXPECT_EQ(manageOpen(), (Bytes{0x6A, 0x81}));  // 8 channels: 7 is the last
  setProp("vendor.ese_sim.min_channel", "");
  EXPECT_EQ(manageOpen(), (Bytes{0x01, 0x90, 0x00}));
  EXPECT_EQ(report(), "1 5 7\n");

  phQvEse_close();
  EXPECT_EQ(report(), "\n");
}

TEST_F(EseSimSwitches, AHungExchangeReturnsOnceThePropertyIsCleared) {
  ASSERT_EQ(phQvEse_init_open(), 0);
  struct Case {
    const char* function;
    std::function<Bytes()> call;
  };
  const Case cases[] = {
      {"phQVNciHal_Transmit_APDU_by_IPC",
       [this] {
         Bytes out;
         EXPECT_EQ(ipc({0x00, 0xCA, 0x00, 0x66, 0x00}, out), 0);
         return Bytes(out.end() - 2, out.end());
       }},
      {"phQvEse_7816_Transceive",
       [] {
         const TransceiveResult t = transceive(0x00, 0xCA, 0x00, 0x66, {}, true);
         EXPECT_EQ(t.rc, 0);
         return Bytes{t.sw1, t.sw2};
       }},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.function);
    StderrTap tap;
    setProp("vendor.ese_sim.hang_exchange", "1");
    std::future<Bytes> call;
    std::future<int32_t> open;
    // Declared after the calls: on an early return it lets them go first.
    const std::shared_ptr<void> unhang(nullptr,
                                       [this](void*) { setProp("vendor.ese_sim.hang_exchange", "0"); });
    call = std::async(std::launch::async, c.call);
    ASSERT_TRUE(tap.waitFor(std::string(c.function) + ": hanging (vendor.ese_sim.hang_exchange)"));
    // The library's lock is held: an open waits for the hung call too.
    open = std::async(std::launch::async, [] { return phQvEse_init_open(); });
    EXPECT_EQ(call.wait_for(std::chrono::seconds(0)), std::future_status::timeout);
    setProp("vendor.ese_sim.hang_exchange", "0");
    EXPECT_EQ(call.get(), (Bytes{0x90, 0x00}));
    EXPECT_EQ(open.get(), 0);
    EXPECT_TRUE(tap.waitFor(std::string(c.function) + ": released"));
  }
}

}  // namespace

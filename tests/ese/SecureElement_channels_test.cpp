// The eSE front's channel operations against the scripted vendor library: the
// commands sent, the status words mapped, the markers, the result delivered
// before the closes and power-offs that follow it, and the bounds on what the
// library hands back.
#include <gtest/gtest.h>

#include <android/log.h>

#include "ese_test_util.h"

using namespace ese_test;

namespace {

using Ipc = fake_ese::IpcReply;
using Trx = fake_ese::TransceiveReply;
constexpr Status OKAY = Status::SUCCESS, FAIL = Status::FAILED, NOCH = Status::CHANNEL_NOT_AVAILABLE,
                 NSE = Status::NO_SUCH_ELEMENT_ERROR, UNSUP = Status::UNSUPPORTED_OPERATION,
                 IOERR = Status::IOERROR;
const std::string R = "ready", M = kManageOpen, CB = "result", P = kPowerOff;
const Trx kOk{0, {}, 0x90, 0x00};
std::string sel(uint8_t c, uint8_t p2 = 0) { return selectLine(c, p2); }
std::string getResponse(uint8_t c, uint8_t le) { return "ipc " + hex2(c) + " C0 00 00 " + hex2(le); }
Bytes operator+(Bytes a, const Bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

constexpr uint8_t kBasic = 0xB0;  // `channel` of a row that opens the basic channel

struct OpenRow {
  std::string name;
  uint8_t channel;  // the channel delivered, or kBasic
  std::vector<Ipc> ipc;
  std::vector<Trx> trx;
  Bytes select;
  Status status;
  Calls calls;  // the library calls and the result callback, in order
  uint8_t p2 = 0;
  unsigned allocFail = 0;  // which working buffer fails, 0 none
  int32_t readyRc = 0;
  std::string log = "";  // a line logged at error level
};

std::vector<OpenRow> openRows() {
  const std::string kOpenSw = "openLogicalChannel OpenLogicalChannel 0700 command Respose value 0x6a81";
  std::vector<OpenRow> rows = {
      // MANAGE CHANNEL open decides the channel; a refusal delivers 0xFF, then powers off.
      {"6A81", 0xFF, {{0, {0x6A, 0x81}}}, {}, {0x6A, 0x81}, NOCH, {R, M, CB, P}, 0, 0, 0, kOpenSw},
      {"6D00", 0xFF, {{0, {0x6D, 0x00}}}, {}, {0x6D, 0x00}, UNSUP, {R, M, CB, P}},
      {"6E00", 0xFF, {{0, {0x6E, 0x00}}}, {}, {0x6E, 0x00}, UNSUP, {R, M, CB, P}},
      {"9001", 0xFF, {{0, {1, 0x90, 0x01}}}, {}, {1, 0x90, 0x01}, FAIL, {R, M, CB, P}},
      {"empty", 0xFF, {{0, {}}}, {}, {}, FAIL, {R, M, CB, P}},
      {"one byte", 0xFF, {{0, {0x01}}}, {}, {}, FAIL, {R, M, CB, P}},  // mended: answered
      {"9000 without channel", 0xFF, {{0, {0x90, 0x00}}}, {}, {0x90, 0x00}, FAIL, {R, M, CB, P}},
      {"ipc failed", 0x7E, {{-1, {0x6A, 0x81}}}, {}, {0x6A, 0x81}, FAIL, {R, M, CB, P}, 0, 0, 0,
       "phQVNciHal_Transmit_APDU_by_IPC failed!!!"},
      {"not ready", 0x7F, {}, {}, {}, IOERR, {R, CB, P}, 0, 0, -1, "phQVNciHal_Set_KORVA_READY failed!!!"},
      {"basic not ready", kBasic, {}, {}, {0x7F}, IOERR, {R, CB, P}, 0, 0, -1},
      // Success: no power-off. P2 7F becomes 00 on logical channels only.
      {"open 1", 1, {{0, {1, 0x90, 0x00}}}, {{0, {0x6F, 0x01}, 0x90, 0x00}}, {0x6F, 0x01, 0x90, 0x00}, OKAY,
       {R, M, sel(1, 0x0C), CB}, 0x0C, 0, 0, "openLogicalChannel OpenLogicalChannel Select AID response value 0x900"},
      {"p2 7F", 2, {{0, {2, 0x90, 0x00}}}, {kOk}, {0x90, 0x00}, OKAY, {R, M, sel(2), CB}, 0x7F},
      {"basic p2 7F", kBasic, {}, {kOk}, {0x90, 0x00}, OKAY, {R, sel(0, 0x7F), CB}, 0x7F},
      // A failed SELECT exchange keeps the MANAGE CHANNEL reply; a failed close is logged
      // and made again once the open has let go of the library.
      {"select exchange fails", 3, {{0, {3, 0x90, 0x00}}}, {{-1, {}, 0x6A, 0x82}, {-1, {}}, kOk}, {3, 0x90, 0x00},
       FAIL, {R, M, sel(3), CB, closeLine(3), P, closeLine(3), P}, 0, 0, 0,
       "openLogicalChannel select return fail,close channel fail "},
      // ... on the basic channel: marker 7E, with the status word the library left.
      {"basic fails 6A82", kBasic, {}, {{-1, {1}, 0x6A, 0x82}}, {0x7E, 0x6A, 0x82}, FAIL, {R, sel(0), CB, P}},
      {"basic fails 9000", kBasic, {}, {{-1, {1}, 0x90, 0x00}}, {0x7E}, FAIL, {R, sel(0), CB, P}},
      {"basic fails 0000", kBasic, {}, {{-1, {}, 0x00, 0x00}}, {0x7E}, FAIL, {R, sel(0), CB, P}},
      {"basic fails 0001", kBasic, {}, {{-1, {}, 0x00, 0x01}}, {0x7E, 0, 1}, FAIL, {R, sel(0), CB, P}},
      // A failed GET RESPONSE exchange.
      {"logical get response fails", 2, {{0, {2, 0x90, 0x00}}, {-1, {0x6A, 0x82}}}, {{0, {0x55}, 0x61, 8}, kOk},
       {0x55, 0x61, 0x08}, FAIL, {R, M, sel(2), getResponse(2, 8), CB, closeLine(2), P}},
      {"basic get response fails", kBasic, {{-1, {1, 0x6A, 0x82}}}, {{0, {}, 0x61, 8}}, {0x7E, 0x6A, 0x82}, FAIL,
       {R, sel(0), getResponse(0, 8), CB, P}},
      {"basic get response fails short", kBasic, {{-1, {0x6A}}}, {{0, {}, 0x61, 8}}, {0x7E}, FAIL,
       {R, sel(0), getResponse(0, 8), CB, P}},
      // Claimed lengths are bounded by the buffers: 256 for the basic SELECT, 270 else.
      {"basic claims 300", kBasic, {}, {{0, Bytes(256, 0x5A), 0x90, 0x00, 300}}, Bytes(256, 0x5A) + Bytes{0x90, 0},
       OKAY, {R, sel(0), CB}},
      {"get response claims 100000", kBasic, {{0, Bytes(270, 0x22), 100000}}, {{0, {}, 0x61, 0}}, Bytes(270, 0x22),
       FAIL, {R, sel(0), getResponse(0, 0), CB, P}},
      {"manage claims 4000", 0xFF, {{0, {1, 0x90, 0x00}, 4000}}, {}, Bytes{1, 0x90, 0} + Bytes(267, 0), FAIL,
       {R, M, CB, P}},
      // Mended: allocation failures deliver one failure. Before MANAGE CHANNEL
      // only the close of channel 0 follows (a power-off); after channel 1 is
      // assigned it stays open and flagged.
      {"alloc 1", 0, {}, {}, {}, FAIL, {CB, P}, 0, 1, 0, "openLogicalChannel cmdApdu.p_data malloc fail!"},
      {"alloc 2", 0, {}, {}, {}, FAIL, {CB, P}, 0, 2, 0, "openLogicalChannel rspApdu.p_data malloc fail!"},
      {"alloc 3", 1, {{0, {1, 0x90, 0x00}}}, {}, {1, 0x90, 0x00}, FAIL, {R, M, CB}, 0, 3, 0,
       "openLogicalChannel cpdu.pdata malloc fail!"},
      {"alloc 6", 1, {{0, {1, 0x90, 0x00}}}, {{0, {}, 0x61, 4}}, {0x61, 0x04}, FAIL, {R, M, sel(1), CB}, 0, 6, 0,
       "openLogicalChannel rspApdu.p_dataa malloc fail!"},
      {"basic alloc 1", kBasic, {}, {}, {}, FAIL, {CB}, 0, 1, 0, "openBasicChannel cpdu.pdata malloc fail!"},
      {"basic alloc 4", kBasic, {}, {{0, {}, 0x61, 4}}, {0x61, 0x04}, FAIL, {R, sel(0), CB}, 0, 4, 0,
       "openBasicChannel rspApdu.p_data malloc fail!"},
  };
  // SELECT status words, both channel kinds: a failure is delivered, then the
  // logical channel is closed and the eSE powered off.
  const std::vector<std::pair<Bytes, Status>> selectSw = {{{0x90, 0x00}, OKAY}, {{0x67, 0x00}, NSE},
                                                          {{0x6A, 0x82}, NSE},  {{0x6A, 0x86}, UNSUP},
                                                          {{0x6A, 0x81}, FAIL}, {{0x90, 0x01}, FAIL}};
  for (const auto& [sw, st] : selectSw) {
    Calls logical{R, M, sel(2), CB}, basic{R, sel(0), CB};
    if (st != OKAY) {
      logical.insert(logical.end(), {closeLine(2), P});
      basic.push_back(P);
    }
    const Trx reply{0, {0xAB}, sw[0], sw[1]};
    rows.push_back({"select " + fake_ese::hex(sw), 2, {{0, {2, 0x90, 0}}}, {reply, kOk}, Bytes{0xAB} + sw, st, logical});
    rows.push_back({"basic select " + fake_ese::hex(sw), kBasic, {}, {reply}, Bytes{0xAB} + sw, st, basic});
  }
  // SELECT 61 xx: one GET RESPONSE with Le xx, whose whole reply is the select
  // response; 6A 82 differs by channel kind; 61 xx is not fetched again.
  const std::vector<std::tuple<Bytes, Status, Status>> gets = {
      {{0x6F, 0x10, 0x90, 0x00}, OKAY, OKAY}, {{0x67, 0x00}, NSE, NSE},   {{0x6A, 0x86}, UNSUP, UNSUP},
      {{0x6A, 0x82}, FAIL, NSE},               {{1, 0x61, 5}, FAIL, FAIL}, {{0x90}, FAIL, FAIL}};
  for (const auto& [reply, logicalSt, basicSt] : gets) {
    Calls logical{R, M, sel(1), getResponse(1, 0x10), CB}, basic{R, sel(0), getResponse(0, 0x2A), CB};
    if (logicalSt != OKAY) logical.insert(logical.end(), {closeLine(1), P});
    if (basicSt != OKAY) basic.push_back(P);
    rows.push_back({"get response " + fake_ese::hex(reply), 1, {{0, {1, 0x90, 0}}, {0, reply}},
                    {{0, {}, 0x61, 0x10}, kOk}, reply, logicalSt, logical});
    rows.push_back({"basic get response " + fake_ese::hex(reply), kBasic, {{0, reply}}, {{0, {}, 0x61, 0x2A}},
                    reply, basicSt, basic});
  }
  return rows;
}

class EseChannels : public EseFixture {};

TEST_F(EseChannels, OpenDeliversOneResultThenClosesAndPowersOffAsNeeded) {
  for (const OpenRow& row : openRows()) {
    SCOPED_TRACE(row.name);
    fake_ese::reset();
    cap.clear();
    for (const auto& r : row.ipc) fake_ese::queueIpc(r);
    for (const auto& r : row.trx) fake_ese::queueTransceive(r);
    fake_ese::setReadyResult(row.readyRc);
    setBufferAllocFailureForTest(row.allocFail);
    const bool basic = row.channel == kBasic;
    OpenResult r = basic ? openBasic(se, kAid, row.p2) : openLogical(se, kAid, row.p2);
    setBufferAllocFailureForTest(0);
    EXPECT_EQ(r.calls, 1);
    EXPECT_EQ(r.channel, basic ? 0 : row.channel);
    EXPECT_EQ(fake_ese::hex(r.select), fake_ese::hex(row.select));
    EXPECT_EQ(r.status, row.status);
    EXPECT_EQ(fake_ese::calls(), row.calls);
    EXPECT_TRUE(row.log.empty() || logged(cap, row.log, ANDROID_LOG_ERROR)) << row.log;
    // A logical channel stays flagged unless the open closed it again.
    const bool flagged = !basic && row.channel >= 1 && row.channel <= 3 &&
                         std::count(row.calls.begin(), row.calls.end(), closeLine(row.channel)) == 0;
    ASSERT_TRUE(SecureElement::gate().idle());
    EXPECT_EQ(sweepFlags(se), flagged ? std::vector<uint8_t>{row.channel} : std::vector<uint8_t>{});
  }
}

TEST_F(EseChannels, CloseChannelAlwaysPowersOff) {
  struct Row {
    uint8_t channel;
    std::vector<Trx> replies;
    Status status;
    Calls calls;
    unsigned allocFail = 0;
  };
  const std::vector<Row> rows = {
      {0, {}, FAIL, {P}},  // the basic channel: nothing sent
      {2, {kOk}, OKAY, {closeLine(2), P}},
      {3, {{0, {}, 0x68, 0x81}}, FAIL, {closeLine(3), P}},
      {1, {{-1, {}, 0x90, 0x00}}, FAIL, {closeLine(1), P}},
      {255, {}, FAIL, {P}},  // mended: no close built from a channel the table cannot hold
      {2, {kOk}, FAIL, {P}, 1},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.calls.front());
    fake_ese::reset();
    for (const auto& rep : row.replies) fake_ese::queueTransceive(rep);
    setBufferAllocFailureForTest(row.allocFail);
    EXPECT_EQ(static_cast<Status>(se->closeChannel(row.channel)), row.status);
    setBufferAllocFailureForTest(0);
    EXPECT_EQ(fake_ese::calls(), row.calls);
  }
  EXPECT_TRUE(logged(cap, "closeChannel rpdu.pdata malloc fail!", ANDROID_LOG_ERROR));

  // Closing one channel leaves the others flagged.
  scriptOpen(1);
  scriptOpen(2);
  ASSERT_EQ(openLogical(se, kAid, 0).status, OKAY);
  ASSERT_EQ(openLogical(se, kAid, 0).status, OKAY);
  fake_ese::queueTransceive(kOk);
  EXPECT_EQ(static_cast<Status>(se->closeChannel(2)), OKAY);
  EXPECT_EQ(sweepFlags(se), (std::vector<uint8_t>{1}));
}

}  // namespace

// The eSE front's channel operations against the scripted vendor library:
// the commands sent, the status words mapped, the markers, the closes and
// power-offs that follow, and the bounds on what the library hands back.
#include <gtest/gtest.h>

#include <android/log.h>

#include "ese_test_util.h"

using namespace ese_test;

namespace {

class EseChannels : public EseFixture {
 protected:
  std::vector<uint8_t> flaggedChannels() { return sweepFlags(se); }
};

// ---- MANAGE CHANNEL open: the reply decides the channel ----

struct ManageRow {
  const char* name;
  fake_ese::IpcReply reply;
  uint8_t channel;
  Status status;
  Bytes select;
};

TEST_F(EseChannels, ManageChannelRefusalsGiveNoChannelAndPowerOff) {
  const std::vector<ManageRow> rows = {
      {"6A81", {0, {0x6A, 0x81}}, 0xFF, Status::CHANNEL_NOT_AVAILABLE, {0x6A, 0x81}},
      {"6D00", {0, {0x6D, 0x00}}, 0xFF, Status::UNSUPPORTED_OPERATION, {0x6D, 0x00}},
      {"6E00", {0, {0x6E, 0x00}}, 0xFF, Status::UNSUPPORTED_OPERATION, {0x6E, 0x00}},
      {"9001", {0, {0x01, 0x90, 0x01}}, 0xFF, Status::FAILED, {0x01, 0x90, 0x01}},
      {"6985", {0, {0x69, 0x85}}, 0xFF, Status::FAILED, {0x69, 0x85}},
      {"empty", {0, {}}, 0xFF, Status::FAILED, {}},
      // Mended: a one-byte reply is answered like an empty one instead of
      // leaving the caller without a result.
      {"one byte", {0, {0x01}}, 0xFF, Status::FAILED, {}},
      // 90 00 with no channel byte in front of it names no channel.
      {"9000 alone", {0, {0x90, 0x00}}, 0xFF, Status::FAILED, {0x90, 0x00}},
      // Channels above 3 are refused too, after a close on the card
      // (SecureElement_faults_test.cpp).
      // The exchange itself failed: marker 7E; bytes it left still become the
      // select response.
      {"ipc failed", {-1, {}}, 0x7E, Status::FAILED, {}},
      {"ipc failed with SW", {-1, {0x6A, 0x81}}, 0x7E, Status::FAILED, {0x6A, 0x81}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    fake_ese::reset();
    fake_ese::queueIpc(row.reply);
    LogicalResult r = openLogical(se, kAid, 0x00);
    EXPECT_EQ(r.calls, 1);
    EXPECT_EQ(r.channel, row.channel);
    EXPECT_EQ(r.status, row.status);
    EXPECT_EQ(r.select, row.select);
    EXPECT_EQ(fake_ese::calls(), (Calls{"ready", kManageOpen, kPowerOff}));
  }
  EXPECT_TRUE(flaggedChannels().empty());
  EXPECT_TRUE(logged(cap, "phQVNciHal_Transmit_APDU_by_IPC failed!!!", ANDROID_LOG_ERROR));
  EXPECT_TRUE(logged(cap, "openLogicalChannel OpenLogicalChannel 0700 command Respose value 0x6a81",
                     ANDROID_LOG_ERROR));
}

TEST_F(EseChannels, ReadyFailureGivesMarker7FAndPowerOffOnBothChannelKinds) {
  fake_ese::setReadyResult(-1);
  LogicalResult l = openLogical(se, kAid, 0x00);
  EXPECT_EQ(l.calls, 1);
  EXPECT_EQ(l.channel, 0x7F);
  EXPECT_TRUE(l.select.empty());
  EXPECT_EQ(l.status, Status::IOERROR);
  EXPECT_EQ(fake_ese::calls(), (Calls{"ready", kPowerOff}));

  fake_ese::clearCalls();
  BasicResult b = openBasic(se, kAid, 0x00);
  EXPECT_EQ(b.calls, 1);
  EXPECT_EQ(b.select, (Bytes{0x7F}));
  EXPECT_EQ(b.status, Status::IOERROR);
  EXPECT_EQ(fake_ese::calls(), (Calls{"ready", kPowerOff}));
  EXPECT_TRUE(logged(cap, "phQVNciHal_Set_KORVA_READY failed!!!", ANDROID_LOG_ERROR));
}

// ---- A successful logical open ----

TEST_F(EseChannels, LogicalOpenSelectsOnTheAssignedChannelAndKeepsItFlagged) {
  fake_ese::queueIpc({0, {0x01, 0x90, 0x00}});
  fake_ese::queueTransceive({0, {0x6F, 0x03, 0x84, 0x01, 0x00}, 0x90, 0x00});
  LogicalResult r = openLogical(se, kAid, 0x0C);
  EXPECT_EQ(r.calls, 1);
  EXPECT_EQ(r.channel, 1);
  EXPECT_EQ(r.select, (Bytes{0x6F, 0x03, 0x84, 0x01, 0x00, 0x90, 0x00}));
  EXPECT_EQ(r.status, Status::SUCCESS);
  // No power-off after a successful open.
  EXPECT_EQ(fake_ese::calls(), (Calls{"ready", kManageOpen, selectLine(0x01, 0x0C)}));
  EXPECT_TRUE(logged(cap, "openLogicalChannel OpenLogicalChannel Select AID response value 0x900",
                     ANDROID_LOG_ERROR));
  EXPECT_EQ(flaggedChannels(), (std::vector<uint8_t>{1}));
}

TEST_F(EseChannels, P2_7FBecomes00OnLogicalChannelsOnly) {
  scriptOpen(2);
  openLogical(se, kAid, 0x7F);
  EXPECT_EQ(fake_ese::calls().back(), selectLine(0x02, 0x00));

  fake_ese::clearCalls();
  fake_ese::queueTransceive({0, {}, 0x90, 0x00});
  openBasic(se, kAid, 0x7F);
  EXPECT_EQ(fake_ese::calls(), (Calls{"ready", selectLine(0x00, 0x7F)}));

  fake_ese::clearCalls();
  fake_ese::queueTransceive({0, {}, 0x90, 0x00});
  openBasic(se, kAid, 0x04);
  EXPECT_EQ(fake_ese::calls(), (Calls{"ready", selectLine(0x00, 0x04)}));
}

// ---- SELECT replies, both channel kinds ----

TEST_F(EseChannels, SelectStatusWordsAndTheCleanUpAfterAFailure) {
  struct Row {
    uint8_t sw1, sw2;
    Status status;
  };
  const std::vector<Row> rows = {
      {0x90, 0x00, Status::SUCCESS},
      {0x67, 0x00, Status::NO_SUCH_ELEMENT_ERROR},
      {0x6A, 0x82, Status::NO_SUCH_ELEMENT_ERROR},
      {0x6A, 0x86, Status::UNSUPPORTED_OPERATION},
      {0x6A, 0x81, Status::FAILED},
      {0x62, 0x83, Status::FAILED},
      {0x90, 0x01, Status::FAILED},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(hex2(row.sw1) + hex2(row.sw2));
    const bool ok = row.status == Status::SUCCESS;
    // Logical: a failed SELECT closes the channel, then powers off.
    fake_ese::reset();
    cap.clear();
    fake_ese::queueIpc({0, {0x02, 0x90, 0x00}});
    fake_ese::queueTransceive({0, {0xAB}, row.sw1, row.sw2});
    fake_ese::queueTransceive({0, {}, 0x90, 0x00});  // the close, if one comes
    LogicalResult r = openLogical(se, kAid, 0x00);
    EXPECT_EQ(r.calls, 1);
    EXPECT_EQ(r.channel, 2);
    EXPECT_EQ(r.status, row.status);
    EXPECT_EQ(r.select, (Bytes{0xAB, row.sw1, row.sw2}));
    Calls expected{"ready", kManageOpen, selectLine(0x02, 0x00)};
    if (!ok) expected.insert(expected.end(), {closeLine(2), kPowerOff});
    EXPECT_EQ(fake_ese::calls(), expected);
    EXPECT_EQ(logged(cap, "openLogicalChannel select return fail,try to close channel 2",
                     ANDROID_LOG_DEBUG), !ok);
    EXPECT_FALSE(logged(cap, "openLogicalChannel select return fail,close channel fail ",
                        ANDROID_LOG_ERROR));

    // Basic: a failed SELECT only powers off.
    fake_ese::reset();
    fake_ese::queueTransceive({0, {0xAB, 0xCD}, row.sw1, row.sw2});
    BasicResult b = openBasic(se, kAid, 0x00);
    EXPECT_EQ(b.calls, 1);
    EXPECT_EQ(b.status, row.status);
    EXPECT_EQ(b.select, (Bytes{0xAB, 0xCD, row.sw1, row.sw2}));
    expected = {"ready", selectLine(0x00, 0x00)};
    if (!ok) expected.push_back(kPowerOff);
    EXPECT_EQ(fake_ese::calls(), expected);
  }
}

TEST_F(EseChannels, FailedSelectExchangeOnLogicalChannelKeepsManageReplyAndCloses) {
  fake_ese::queueIpc({0, {0x03, 0x90, 0x00}});
  fake_ese::queueTransceive({-1, {}, 0x6A, 0x82});
  fake_ese::queueTransceive({-1, {}, 0x00, 0x00});  // the close fails too
  LogicalResult r = openLogical(se, kAid, 0x00);
  EXPECT_EQ(r.channel, 3);
  EXPECT_EQ(r.status, Status::FAILED);
  EXPECT_EQ(r.select, (Bytes{0x03, 0x90, 0x00}));
  EXPECT_EQ(fake_ese::calls(),
            (Calls{"ready", kManageOpen, selectLine(0x03, 0x00), closeLine(3), kPowerOff}));
  EXPECT_TRUE(logged(cap, "openLogicalChannel select return fail,close channel fail ",
                     ANDROID_LOG_ERROR));
  EXPECT_TRUE(flaggedChannels().empty());
}

TEST_F(EseChannels, FailedBasicSelectExchangeGivesMarker7EWithTheStatusWordLeft) {
  struct Row {
    uint8_t sw1, sw2;
    Bytes expected;
  };
  const std::vector<Row> rows = {
      {0x6A, 0x82, {0x7E, 0x6A, 0x82}},
      {0x90, 0x00, {0x7E}},
      {0x00, 0x00, {0x7E}},
      {0x90, 0x01, {0x7E, 0x90, 0x01}},
      {0x00, 0x01, {0x7E, 0x00, 0x01}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(hex2(row.sw1) + hex2(row.sw2));
    fake_ese::reset();
    fake_ese::queueTransceive({-1, {0x11, 0x22}, row.sw1, row.sw2});
    BasicResult r = openBasic(se, kAid, 0x00);
    EXPECT_EQ(r.calls, 1);
    EXPECT_EQ(r.select, row.expected);
    EXPECT_EQ(r.status, Status::FAILED);
    EXPECT_EQ(fake_ese::calls(), (Calls{"ready", selectLine(0x00, 0x00), kPowerOff}));
  }
}

// ---- GET RESPONSE after 61xx, fetched once on the channel of the SELECT ----

TEST_F(EseChannels, Select61xxFetchesOnceWithGetResponse) {
  struct Row {
    const char* name;
    fake_ese::IpcReply reply;
    Status logical;
    Status basic;
  };
  const std::vector<Row> rows = {
      {"9000", {0, {0x6F, 0x10, 0x90, 0x00}}, Status::SUCCESS, Status::SUCCESS},
      {"6700", {0, {0x67, 0x00}}, Status::NO_SUCH_ELEMENT_ERROR, Status::NO_SUCH_ELEMENT_ERROR},
      {"6A86", {0, {0x6A, 0x86}}, Status::UNSUPPORTED_OPERATION, Status::UNSUPPORTED_OPERATION},
      {"6A82", {0, {0x6A, 0x82}}, Status::FAILED, Status::NO_SUCH_ELEMENT_ERROR},
      // More data pending is not fetched: there is no second GET RESPONSE.
      {"6105", {0, {0x01, 0x02, 0x61, 0x05}}, Status::FAILED, Status::FAILED},
      {"6F00", {0, {0x6F, 0x00}}, Status::FAILED, Status::FAILED},
      {"one byte", {0, {0x90}}, Status::FAILED, Status::FAILED},
      {"empty", {0, {}}, Status::FAILED, Status::FAILED},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    fake_ese::reset();
    fake_ese::queueIpc({0, {0x01, 0x90, 0x00}});
    fake_ese::queueTransceive({0, {}, 0x61, 0x10});
    fake_ese::queueIpc(row.reply);
    fake_ese::queueTransceive({0, {}, 0x90, 0x00});  // the close, if one comes
    LogicalResult r = openLogical(se, kAid, 0x00);
    EXPECT_EQ(r.calls, 1);
    EXPECT_EQ(r.channel, 1);
    EXPECT_EQ(r.status, row.logical);
    EXPECT_EQ(r.select, row.reply.bytes);
    Calls expected{"ready", kManageOpen, selectLine(0x01, 0x00), "ipc 01 C0 00 00 10"};
    if (row.logical != Status::SUCCESS) expected.insert(expected.end(), {closeLine(1), kPowerOff});
    EXPECT_EQ(fake_ese::calls(), expected);

    fake_ese::reset();
    fake_ese::queueTransceive({0, {}, 0x61, 0x2A});
    fake_ese::queueIpc(row.reply);
    BasicResult b = openBasic(se, kAid, 0x00);
    EXPECT_EQ(b.calls, 1);
    EXPECT_EQ(b.status, row.basic);
    EXPECT_EQ(b.select, row.reply.bytes);
    expected = {"ready", selectLine(0x00, 0x00), "ipc 00 C0 00 00 2A"};
    if (row.basic != Status::SUCCESS) expected.push_back(kPowerOff);
    EXPECT_EQ(fake_ese::calls(), expected);
  }
  EXPECT_TRUE(logged(cap, "openLogicalChannel enter! 0x61", ANDROID_LOG_INFO));
  EXPECT_TRUE(logged(cap, "openLogicalChannel enter! 0x900", ANDROID_LOG_ERROR));
  EXPECT_TRUE(logged(cap, "openBasicChannel enter! 0x61", ANDROID_LOG_INFO));
  EXPECT_TRUE(logged(cap, "openBasicChannel enter! 0x6a82", ANDROID_LOG_INFO));
}

TEST_F(EseChannels, FailedGetResponseExchange) {
  // Logical: the select response stays the SELECT reply.
  fake_ese::queueIpc({0, {0x02, 0x90, 0x00}});
  fake_ese::queueTransceive({0, {0x55}, 0x61, 0x08});
  fake_ese::queueIpc({-1, {0x6A, 0x82}});
  fake_ese::queueTransceive({0, {}, 0x90, 0x00});
  LogicalResult l = openLogical(se, kAid, 0x00);
  EXPECT_EQ(l.status, Status::FAILED);
  EXPECT_EQ(l.select, (Bytes{0x55, 0x61, 0x08}));

  // Basic: marker 7E, followed by the status word the library left, if any.
  fake_ese::queueTransceive({0, {}, 0x61, 0x08});
  fake_ese::queueIpc({-1, {0x01, 0x6A, 0x82}});
  BasicResult b = openBasic(se, kAid, 0x00);
  EXPECT_EQ(b.status, Status::FAILED);
  EXPECT_EQ(b.select, (Bytes{0x7E, 0x6A, 0x82}));

  fake_ese::queueTransceive({0, {}, 0x61, 0x08});
  fake_ese::queueIpc({-1, {0x6A}});
  b = openBasic(se, kAid, 0x00);
  EXPECT_EQ(b.select, (Bytes{0x7E}));
}

// ---- closeChannel ----

TEST_F(EseChannels, CloseChannel) {
  struct Row {
    const char* name;
    uint8_t channel;
    std::vector<fake_ese::TransceiveReply> replies;
    Status status;
    Calls calls;
  };
  const std::vector<Row> rows = {
      {"basic channel sends nothing", 0, {}, Status::FAILED, {kPowerOff}},
      {"9000", 2, {{0, {}, 0x90, 0x00}}, Status::SUCCESS, {closeLine(2), kPowerOff}},
      {"6881", 3, {{0, {}, 0x68, 0x81}}, Status::FAILED, {closeLine(3), kPowerOff}},
      {"exchange fails", 1, {{-1, {}, 0x90, 0x00}}, Status::FAILED, {closeLine(1), kPowerOff}},
      // Mended: a channel the table cannot hold is never indexed, and no
      // close is built from it (its CLA would name another channel).
      {"channel 4", 4, {}, Status::FAILED, {kPowerOff}},
      {"channel 255", 255, {}, Status::FAILED, {kPowerOff}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    fake_ese::reset();
    for (const auto& rep : row.replies) fake_ese::queueTransceive(rep);
    EXPECT_EQ(static_cast<Status>(se->closeChannel(row.channel)), row.status);
    EXPECT_EQ(fake_ese::calls(), row.calls);
  }
  EXPECT_TRUE(logged(cap, "closeChannel enter!", ANDROID_LOG_INFO));
}

TEST_F(EseChannels, CloseOneChannelLeavesTheOthersFlaggedAndStillPowersOff) {
  scriptOpen(1);
  ASSERT_EQ(openLogical(se, kAid, 0).status, Status::SUCCESS);
  scriptOpen(2);
  ASSERT_EQ(openLogical(se, kAid, 0).status, Status::SUCCESS);
  fake_ese::clearCalls();
  fake_ese::queueTransceive({0, {}, 0x90, 0x00});
  EXPECT_EQ(static_cast<Status>(se->closeChannel(2)), Status::SUCCESS);
  EXPECT_EQ(fake_ese::calls(), (Calls{closeLine(2), kPowerOff}));
  EXPECT_EQ(flaggedChannels(), (std::vector<uint8_t>{1}));
}

// ---- Lengths the library hands back are bounded by the buffers ----

TEST_F(EseChannels, ReportedLengthsNeverExceedTheBuffers) {
  // Basic SELECT: 256-byte buffer, the library claims 300 data bytes.
  Bytes full256(256, 0x5A);
  fake_ese::queueTransceive({0, full256, 0x90, 0x00, 300});
  BasicResult b = openBasic(se, kAid, 0x00);
  ASSERT_EQ(b.select.size(), 258u);
  EXPECT_EQ(Bytes(b.select.begin(), b.select.begin() + 256), full256);
  EXPECT_EQ(b.status, Status::SUCCESS);

  // Logical SELECT: 270-byte buffer, the library claims 65535.
  fake_ese::queueIpc({0, {0x01, 0x90, 0x00}});
  fake_ese::queueTransceive({0, Bytes(10, 0x11), 0x90, 0x00, 65535});
  LogicalResult l = openLogical(se, kAid, 0x00);
  EXPECT_EQ(l.select.size(), 272u);

  // GET RESPONSE: 270-byte buffer, the library claims 100000.
  Bytes full270(268, 0x22);
  full270.push_back(0x90);
  full270.push_back(0x00);
  fake_ese::queueTransceive({0, {}, 0x61, 0x00});
  fake_ese::queueIpc({0, full270, 100000});
  b = openBasic(se, kAid, 0x00);
  EXPECT_EQ(b.select, full270);
  EXPECT_EQ(b.status, Status::SUCCESS);

  // MANAGE CHANNEL open: the claimed length runs past the reply into zeros,
  // which end the buffer; its last two bytes are no 90 00.
  fake_ese::queueIpc({0, {0x01, 0x90, 0x00}, 4000});
  l = openLogical(se, kAid, 0x00);
  EXPECT_EQ(l.channel, 0xFF);
  EXPECT_EQ(l.select.size(), 270u);
}

// ---- Mended: allocation failures still deliver one failure result ----

TEST_F(EseChannels, LogicalOpenAllocationFailuresDeliverOneFailure) {
  struct Row {
    unsigned nth;  // which working buffer fails
    const char* log;
    uint8_t channel;
    Calls calls;  // what reaches the library, the clean-up included
  };
  const std::vector<Row> rows = {
      // Before MANAGE CHANNEL: the close of channel 0 only asks the power-off.
      {1, "openLogicalChannel cmdApdu.p_data malloc fail!", 0, {kPowerOff}},
      {2, "openLogicalChannel rspApdu.p_data malloc fail!", 0, {kPowerOff}},
      // After channel 1 is assigned: it stays open and flagged, no power-off.
      {3, "openLogicalChannel cpdu.pdata malloc fail!", 1, {"ready", kManageOpen}},
      {4, "openLogicalChannel rpdu.pdata malloc fail!", 1, {"ready", kManageOpen}},
      {5, "openLogicalChannel cmdApdu.p_data malloc fail!", 1,
       {"ready", kManageOpen, selectLine(1, 0)}},
      {6, "openLogicalChannel rspApdu.p_dataa malloc fail!", 1,
       {"ready", kManageOpen, selectLine(1, 0)}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.nth);
    fake_ese::reset();
    cap.clear();
    fake_ese::queueIpc({0, {0x01, 0x90, 0x00}});
    fake_ese::queueTransceive({0, {}, 0x61, 0x04});
    setBufferAllocFailureForTest(row.nth);
    LogicalResult r = openLogical(se, kAid, 0x00);
    setBufferAllocFailureForTest(0);
    EXPECT_EQ(r.calls, 1);
    EXPECT_EQ(r.status, Status::FAILED);
    EXPECT_EQ(r.channel, row.channel);
    EXPECT_EQ(fake_ese::calls(), row.calls);
    EXPECT_TRUE(logged(cap, row.log, ANDROID_LOG_ERROR));
    if (row.nth <= 2) {
      EXPECT_TRUE(logged(cap, "openLogicalChannel select return fail,close channel fail ",
                         ANDROID_LOG_ERROR));
    } else {
      EXPECT_EQ(flaggedChannels(), (std::vector<uint8_t>{1}));
    }
  }
}

TEST_F(EseChannels, BasicOpenAllocationFailuresDeliverOneFailureWithoutPowerOff) {
  struct Row {
    unsigned nth;
    const char* log;
    Calls calls;
    Bytes select;
  };
  const std::vector<Row> rows = {
      {1, "openBasicChannel cpdu.pdata malloc fail!", {}, {}},
      {2, "openBasicChannel rpdu.pdata malloc fail!", {}, {}},
      {3, "openBasicChannel cmdApdu.p_data malloc fail!", {"ready", selectLine(0, 0)}, {0x61, 0x04}},
      {4, "openBasicChannel rspApdu.p_data malloc fail!", {"ready", selectLine(0, 0)}, {0x61, 0x04}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.nth);
    fake_ese::reset();
    cap.clear();
    fake_ese::queueTransceive({0, {}, 0x61, 0x04});
    setBufferAllocFailureForTest(row.nth);
    BasicResult r = openBasic(se, kAid, 0x00);
    setBufferAllocFailureForTest(0);
    EXPECT_EQ(r.calls, 1);
    EXPECT_EQ(r.status, Status::FAILED);
    EXPECT_EQ(r.select, row.select);
    EXPECT_EQ(fake_ese::calls(), row.calls);
    EXPECT_TRUE(logged(cap, row.log, ANDROID_LOG_ERROR));
  }
}

TEST_F(EseChannels, CloseAllocationFailureIsAFailedClose) {
  setBufferAllocFailureForTest(1);
  EXPECT_EQ(static_cast<Status>(se->closeChannel(2)), Status::FAILED);
  EXPECT_EQ(fake_ese::calls(), (Calls{kPowerOff}));
  EXPECT_TRUE(logged(cap, "closeChannel rpdu.pdata malloc fail!", ANDROID_LOG_ERROR));
}

}  // namespace

// The AIDL face over a scripted HIDL front: how results and statuses are
// translated, what is checked before anything is sent, and what reset does.
#include <gtest/gtest.h>

#include <aidl/android/hardware/secure_element/BnSecureElementCallback.h>

#include <optional>
#include <set>
#include <string>
#include <vector>

#include "aidl_front.h"

namespace {

using ::aidl::android::hardware::secure_element::AidlFront;
using ::aidl::android::hardware::secure_element::BnSecureElementCallback;
using ::aidl::android::hardware::secure_element::ISecureElement;
using ::aidl::android::hardware::secure_element::LogicalChannelResponse;
using ::android::sp;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::Void;
using ::android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using ::android::hardware::secure_element::V1_0::SecureElementStatus;
using ::ndk::ScopedAStatus;
using Bytes = std::vector<uint8_t>;
using HidlResponse = ::android::hardware::secure_element::V1_0::LogicalChannelResponse;
using HidlSE = ::android::hardware::secure_element::V1_0::ISecureElement;

// Answers as scripted and records each call ("close 2", "transmit", ...).
class ScriptedHidl : public HidlSE {
 public:
  Return<void> init(const sp<ISecureElementHalCallback>& cb) override {
    calls.push_back(cb == nullptr ? "init null" : "init");
    if (cb != nullptr && comesUp) cb->onStateChange(true);
    return Void();
  }
  Return<void> getAtr(getAtr_cb cb) override { return cb({}), Void(); }
  Return<bool> isCardPresent() override { return true; }
  Return<void> transmit(const hidl_vec<uint8_t>&, transmit_cb cb) override {
    calls.push_back("transmit");
    return cb(transmitAnswer), Void();
  }
  Return<void> openLogicalChannel(const hidl_vec<uint8_t>&, uint8_t,
                                  openLogicalChannel_cb cb) override {
    calls.push_back("open");
    if (openAnswer) {
      cb(openAnswer->first, openAnswer->second);
      if (openAnswer->second == SecureElementStatus::SUCCESS) open.insert(openAnswer->first.channelNumber);
    }
    return Void();
  }
  Return<void> openBasicChannel(const hidl_vec<uint8_t>&, uint8_t, openBasicChannel_cb cb) override {
    calls.push_back("basic");
    return cb(basicSelect, basicStatus), Void();
  }
  Return<SecureElementStatus> closeChannel(uint8_t c) override {
    calls.push_back("close " + std::to_string(c));
    open.erase(c);
    return closeStatus;
  }

  std::vector<std::string> calls;
  std::set<uint8_t> open;  // the front's channel table
  bool comesUp = true;
  hidl_vec<uint8_t> transmitAnswer = {0x90, 0x00};
  std::optional<std::pair<HidlResponse, SecureElementStatus>> openAnswer;
  hidl_vec<uint8_t> basicSelect = {0x90, 0x00};
  SecureElementStatus basicStatus = SecureElementStatus::SUCCESS;
  SecureElementStatus closeStatus = SecureElementStatus::SUCCESS;
};

class States : public BnSecureElementCallback {
 public:
  ScopedAStatus onStateChange(bool connected, const std::string&) override {
    seen.push_back(connected);
    return ScopedAStatus::ok();
  }
  std::vector<bool> seen;
};

std::string nameOf(const ScopedAStatus& st) {
  if (st.isOk()) return "SUCCESS";
  if (st.getExceptionCode() != EX_SERVICE_SPECIFIC) return "EX " + std::to_string(st.getExceptionCode());
  const char* names[] = {"?", "FAILED", "CHANNEL_NOT_AVAILABLE", "NO_SUCH_ELEMENT_ERROR",
                         "UNSUPPORTED_OPERATION", "IOERROR"};
  const int32_t c = st.getServiceSpecificError();
  return c >= 1 && c <= 5 ? names[c] : "code " + std::to_string(c);
}

class AidlFrontTest : public ::testing::Test {
 protected:
  AidlFrontTest()
      : hidl(new ScriptedHidl()),
        front(::ndk::SharedRefBase::make<AidlFront>(
            hidl, "eSE1",
            AidlFront::Element{[this](uint8_t c) { return hidl->open.count(c) != 0; },
                               [this] { ++releases; return true; }})),
        states(::ndk::SharedRefBase::make<States>()) {}

  sp<ScriptedHidl> hidl;
  std::shared_ptr<AidlFront> front;
  std::shared_ptr<States> states;
  int releases = 0;
};

HidlResponse response(uint8_t channel, const Bytes& select) {
  HidlResponse r;
  r.channelNumber = channel;
  r.selectResponse = select;
  return r;
}

TEST_F(AidlFrontTest, OpenLogicalChannelSucceedsOnlyWithAUsableChannel) {
  struct Row {
    std::optional<std::pair<HidlResponse, SecureElementStatus>> hidl;
    std::string want;
    std::vector<std::string> calls;
  };
  const SecureElementStatus ok = SecureElementStatus::SUCCESS;
  const std::vector<Row> rows = {
      {{{response(1, {0x6F, 0x00, 0x90, 0x00}), ok}}, "SUCCESS", {"open"}},
      {{{response(19, {0x90, 0x00}), ok}}, "SUCCESS", {"open"}},
      // The HIDL front's failures keep their status.
      {{{response(0xFF, {0x6A, 0x81}), SecureElementStatus::CHANNEL_NOT_AVAILABLE}},
       "CHANNEL_NOT_AVAILABLE", {"open"}},
      {{{response(0, {}), SecureElementStatus::NO_SUCH_ELEMENT_ERROR}}, "NO_SUCH_ELEMENT_ERROR",
       {"open"}},
      {{{response(0x7F, {}), SecureElementStatus::IOERROR}}, "IOERROR", {"open"}},
      // Opened but unusable: closed again, and FAILED.
      {{{response(2, {}), ok}}, "FAILED", {"open", "close 2"}},
      {{{response(3, {0x90}), ok}}, "FAILED", {"open", "close 3"}},
      // No channel number the interface allows: nothing to close.
      {{{response(0, {0x90, 0x00}), ok}}, "FAILED", {"open"}},
      {{{response(20, {0x90, 0x00}), ok}}, "FAILED", {"open"}},
      // No result at all.
      {std::nullopt, "FAILED", {"open"}},
  };
  for (const Row& row : rows) {
    hidl->calls.clear();
    hidl->openAnswer = row.hidl;
    LogicalChannelResponse out;
    ScopedAStatus st = front->openLogicalChannel({0xA0, 0x01}, 0, &out);
    const int channel = row.hidl ? row.hidl->first.channelNumber : -1;
    EXPECT_EQ(nameOf(st), row.want) << channel;
    EXPECT_EQ(hidl->calls, row.calls) << channel;
    if (st.isOk()) {
      EXPECT_EQ(out.channelNumber, channel);
      EXPECT_EQ(out.selectResponse, Bytes(row.hidl->first.selectResponse));
    }
  }
}

TEST_F(AidlFrontTest, TransmitGoesOnlyToAnOpenChannelAndAnAnswerWithoutStatusWordFails) {
  hidl->open = {1, 5, 19};
  struct Row {
    Bytes apdu;
    Bytes answer;
    std::string want;
    bool sent;
  };
  const std::vector<Row> rows = {
      {{0x01, 0xCA, 0x00, 0x00}, {0x90, 0x00}, "SUCCESS", true},
      {{0x41, 0xCA, 0x00, 0x00}, {0x6A, 0x82}, "SUCCESS", true},  // 5: further interindustry
      {{0x4F, 0xCA, 0x00, 0x00}, {0x90, 0x00}, "SUCCESS", true},  // 19
      {{0x81, 0xCA, 0x00, 0x00}, {0x90, 0x00}, "SUCCESS", true},  // proprietary class, channel 1
      {{0x02, 0xCA, 0x00, 0x00}, {0x90, 0x00}, "CHANNEL_NOT_AVAILABLE", false},
      {{0x00, 0xCA, 0x00, 0x00}, {0x90, 0x00}, "CHANNEL_NOT_AVAILABLE", false},  // basic not open
      {{0x01, 0xCA, 0x00, 0x00}, {0x1F}, "CHANNEL_NOT_AVAILABLE", true},
      {{0x01, 0xCA, 0x00, 0x00}, {}, "CHANNEL_NOT_AVAILABLE", true},
      {{0x01, 0xCA, 0x00}, {0x90, 0x00}, "EX -3", false},
      {{0xFF, 0xCA, 0x00, 0x00}, {0x90, 0x00}, "EX -3", false},
  };
  for (const Row& row : rows) {
    hidl->calls.clear();
    hidl->transmitAnswer = row.answer;
    Bytes out = {0xEE};
    ScopedAStatus st = front->transmit(row.apdu, &out);
    EXPECT_EQ(nameOf(st), row.want) << int(row.apdu[0]);
    EXPECT_EQ(hidl->calls.size(), row.sent ? 1u : 0u) << int(row.apdu[0]);
    EXPECT_EQ(out, st.isOk() ? row.answer : Bytes{0xEE});
  }
}

TEST_F(AidlFrontTest, CloseChannelSendsNothingForAChannelThatIsNotOpen) {
  hidl->open = {2};
  for (int8_t ch : {0, 3, -1}) EXPECT_EQ(nameOf(front->closeChannel(ch)), "FAILED") << int(ch);
  EXPECT_TRUE(hidl->calls.empty());
  hidl->closeStatus = SecureElementStatus::FAILED;
  hidl->open = {2, 4};
  EXPECT_EQ(nameOf(front->closeChannel(2)), "FAILED");
  hidl->closeStatus = SecureElementStatus::SUCCESS;
  EXPECT_EQ(nameOf(front->closeChannel(4)), "SUCCESS");
  EXPECT_EQ(hidl->calls, (std::vector<std::string>{"close 2", "close 4"}));
}

TEST_F(AidlFrontTest, TheBasicChannelIsOpenFromASuccessfulOpenUntilItsClose) {
  Bytes select;
  hidl->basicStatus = SecureElementStatus::NO_SUCH_ELEMENT_ERROR;
  EXPECT_EQ(nameOf(front->openBasicChannel({0xA0}, 0, &select)), "NO_SUCH_ELEMENT_ERROR");
  hidl->basicStatus = SecureElementStatus::SUCCESS;
  hidl->basicSelect = Bytes{0x90};  // no status word: not usable
  EXPECT_EQ(nameOf(front->openBasicChannel({0xA0}, 0, &select)), "FAILED");
  hidl->basicSelect = Bytes{0x90, 0x00};
  EXPECT_EQ(nameOf(front->openBasicChannel({0xA0}, 0, &select)), "SUCCESS");
  EXPECT_EQ(nameOf(front->openBasicChannel({0xA0}, 0, &select)), "CHANNEL_NOT_AVAILABLE");
  Bytes out;
  EXPECT_EQ(nameOf(front->transmit({0x00, 0xCA, 0x00, 0x00}, &out)), "SUCCESS");
  EXPECT_EQ(nameOf(front->closeChannel(0)), "SUCCESS");
  EXPECT_EQ(nameOf(front->closeChannel(0)), "FAILED");
  EXPECT_EQ(hidl->calls, (std::vector<std::string>{"basic", "basic", "basic", "transmit", "close 0"}));
}

TEST_F(AidlFrontTest, ResetClosesEveryChannelThenReportsFalseAndTrue) {
  EXPECT_EQ(nameOf(front->reset()), "FAILED");  // no init yet
  EXPECT_TRUE(hidl->calls.empty());
  ASSERT_EQ(nameOf(front->init(states)), "SUCCESS");
  Bytes select;
  ASSERT_EQ(nameOf(front->openBasicChannel({0xA0}, 0, &select)), "SUCCESS");
  hidl->open = {1, 7, 19};
  hidl->calls.clear();
  EXPECT_EQ(nameOf(front->reset()), "SUCCESS");
  EXPECT_EQ(hidl->calls, (std::vector<std::string>{"close 1", "close 7", "close 19", "close 0", "init"}));
  EXPECT_EQ(releases, 1);
  EXPECT_EQ(states->seen, (std::vector<bool>{true, false, true}));
  Bytes out;
  EXPECT_EQ(nameOf(front->transmit({0x00, 0xCA, 0x00, 0x00}, &out)), "CHANNEL_NOT_AVAILABLE");

  hidl->comesUp = false;
  EXPECT_EQ(nameOf(front->reset()), "FAILED");
  EXPECT_EQ(states->seen, (std::vector<bool>{true, false, true, false}));
}

}  // namespace

// The daemon's start-up against a fake registry (the RPC host's test hooks)
// and the scripted vendor library's eSE type.
#include <gtest/gtest.h>

#include <climits>
#include <map>
#include <string>
#include <vector>

#include <android/log.h>
#include <host/log_capture.h>
#include <host/rpc_hooks.h>

#include "SecureElement.h"
#include "ZerbSimSecureElement.h"
#include "ese_qv_hal.h"
#include "fake_ese_hal.h"
#include "service.h"

namespace {

using ::android::sp;
using ::android::status_t;
using ::android::hardware::secure_element::V1_0::implementation::SecureElement;
using ::android::hardware::secure_element::V1_0::implementation::ZerbSimSecureElement;
using ::android::hidl::base::V1_0::IBase;
using Events = std::vector<std::string>;

constexpr const char* kTag = "qvese@1.0-service";

std::string aidlName(const std::string& instance) {
  return "android.hardware.secure_element.ISecureElement/" + instance;
}

class ServiceStart : public ::testing::Test {
 protected:
  void SetUp() override {
    fake_ese::reset();
    hooks.registerService = [this](const std::string& descriptor, const std::string& name,
                                   const sp<IBase>& service) -> status_t {
      events.push_back("register " + name + " type=" + std::to_string(g_korva_exist));
      // AIDL instances go by their interface's full name.
      if (name.find('/') != std::string::npos) {
        EXPECT_EQ(name.rfind(descriptor + "/", 0), 0u);
      }
      if (name == "eSE1") eseRegistered = dynamic_cast<SecureElement*>(service.get()) != nullptr;
      if (name == "SIM1") {
        auto* s = dynamic_cast<ZerbSimSecureElement*>(service.get());
        simModemId = s ? s->modemId() : -100;
      }
      auto it = failures.find(name);
      return it == failures.end() ? ::android::OK : it->second;
    };
    hooks.configureThreadpool = [this](size_t n, bool join) {
      events.push_back("configure " + std::to_string(n) + (join ? " join" : " nojoin"));
    };
    hooks.joinThreadpool = [this] { events.push_back("join"); };
    ::android::host::setRpcHooks(&hooks);
  }
  void TearDown() override { ::android::host::setRpcHooks(nullptr); }

  // A record with exactly this text under the service's tag in the main buffer.
  int priorityOf(const std::string& text) {
    for (const auto& r : cap.records())
      if (r.text == text && r.tag == kTag && r.buffer == LOG_ID_MAIN) return r.priority;
    return -1;
  }

  ::android::host::LogCapture cap;
  ::android::host::RpcHooks hooks;
  Events events;
  std::map<std::string, status_t> failures;
  // What was registered, looked at while the entry still holds it.
  bool eseRegistered = false;
  int simModemId = -1;
};

TEST_F(ServiceStart, TheEseTypeDecidesWhichInstancesAreServed) {
  struct Row {
    int32_t type;
    Events events;
  };
  // The AIDL faces come after the HIDL instances, eSE1 only with an eSE.
  const Events both = {"configure 4 join", "register eSE1 type=", "configure 4 join",
                       "register SIM1 type=", "register " + aidlName("eSE1") + " type=",
                       "register " + aidlName("SIM1") + " type=", "join"};
  const Events simOnly = {"configure 4 join", "register SIM1 type=",
                          "register " + aidlName("SIM1") + " type=", "join"};
  const std::vector<Row> rows = {
      {0, simOnly}, {1, both}, {2, both}, {3, simOnly}, {-1, simOnly},
      {INT32_MIN, simOnly}, {INT32_MAX, simOnly},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.type);
    fake_ese::reset();
    events.clear();
    cap.clear();
    eseRegistered = false;
    simModemId = -1;
    g_korva_exist = 12345;
    fake_ese::setEseType(row.type);

    EXPECT_EQ(qvese_service_main(), 1);

    // The type is stored before anything is registered.
    Events expected = row.events;
    for (auto& e : expected)
      if (e.rfind("register", 0) == 0) e += std::to_string(row.type);
    EXPECT_EQ(events, expected);
    EXPECT_EQ(g_korva_exist, row.type);
    // The only library call of the start-up is the type query.
    EXPECT_EQ(fake_ese::calls(), (Events{"type"}));

    EXPECT_EQ(priorityOf("ecure Element HAL Service 1.0 is starting"), ANDROID_LOG_INFO);
    EXPECT_EQ(priorityOf("g_ese_type = " + std::to_string(row.type) + "!"), ANDROID_LOG_ERROR);
    const bool hasEse = row.type == 1 || row.type == 2;
    EXPECT_EQ(priorityOf("SecureElement Registered eSE1 success"),
              hasEse ? ANDROID_LOG_INFO : -1);
    EXPECT_EQ(cap.contains("eSE1", kTag), hasEse);
    EXPECT_EQ(priorityOf("ZerbSimSecureElement Registered sim1 success"), ANDROID_LOG_INFO);
    EXPECT_EQ(priorityOf("AIDL Registered " + aidlName("eSE1") + " success"),
              hasEse ? ANDROID_LOG_INFO : -1);
    EXPECT_EQ(priorityOf("AIDL Registered " + aidlName("SIM1") + " success"), ANDROID_LOG_INFO);
    EXPECT_EQ(eseRegistered, hasEse);
    EXPECT_EQ(simModemId, 0);
  }
}

TEST_F(ServiceStart, FailedEseRegistrationRegistersNoSim) {
  fake_ese::setEseType(1);
  failures["eSE1"] = ::android::UNKNOWN_ERROR;
  EXPECT_EQ(qvese_service_main(), 1);
  EXPECT_EQ(events, (Events{"configure 4 join", "register eSE1 type=1"}));
  EXPECT_EQ(priorityOf("SecureElement Registered eSE1 fail"), ANDROID_LOG_ERROR);
  EXPECT_EQ(priorityOf("SecureElement Registered eSE1 success"), -1);
  // The SIM instance was never even built.
  EXPECT_FALSE(cap.contains("modemid", "ZerbSimSecureElement"));
}

TEST_F(ServiceStart, FailedSimRegistrationEndsWithoutJoining) {
  for (int32_t type : {1, 0}) {
    SCOPED_TRACE(type);
    events.clear();
    cap.clear();
    fake_ese::setEseType(type);
    failures["SIM1"] = -1;
    EXPECT_EQ(qvese_service_main(), 1);
    Events expected = {"configure 4 join", "register SIM1 type=" + std::to_string(type)};
    if (type == 1)
      expected.insert(expected.begin(), {"configure 4 join", "register eSE1 type=1"});
    EXPECT_EQ(events, expected);
    EXPECT_EQ(priorityOf("ZerbSimSecureElement Registered sim1 fail"), ANDROID_LOG_ERROR);
    EXPECT_EQ(priorityOf("ZerbSimSecureElement Registered sim1 success"), -1);
  }
}

}  // namespace

namespace {

// A failed AIDL registration ends the process like a HIDL one: no join, and
// for eSE1 no SIM1 face.
TEST_F(ServiceStart, FailedAidlRegistrationEndsWithoutJoining) {
  struct Row {
    std::string failing;
    Events tail;  // after the HIDL registrations
  };
  const std::vector<Row> rows = {
      {aidlName("eSE1"), {"register " + aidlName("eSE1") + " type=1"}},
      {aidlName("SIM1"),
       {"register " + aidlName("eSE1") + " type=1", "register " + aidlName("SIM1") + " type=1"}},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.failing);
    events.clear();
    cap.clear();
    failures.clear();
    fake_ese::setEseType(1);
    failures[row.failing] = ::android::UNKNOWN_ERROR;
    EXPECT_EQ(qvese_service_main(), 1);
    Events expected = {"configure 4 join", "register eSE1 type=1", "configure 4 join",
                       "register SIM1 type=1"};
    expected.insert(expected.end(), row.tail.begin(), row.tail.end());
    EXPECT_EQ(events, expected);
    EXPECT_EQ(priorityOf("AIDL Registered " + row.failing + " fail"), ANDROID_LOG_ERROR);
  }
}

}  // namespace

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

class ServiceStart : public ::testing::Test {
 protected:
  void SetUp() override {
    fake_ese::reset();
    hooks.registerService = [this](const std::string&, const std::string& name,
                                   const sp<IBase>& service) -> status_t {
      events.push_back("register " + name + " type=" + std::to_string(g_korva_exist));
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

TEST_F(ServiceStart, TheEseTypeDecidesWhichInstancesAreServedAndAFailedRegistrationEndsIt) {
  struct Row {
    int32_t type;
    std::string failing;  // the instance whose registration fails, or ""
    std::vector<std::string> tried;  // the instances registered, in order
  };
  const std::vector<std::string> both = {"eSE1", "SIM1"}, simOnly = {"SIM1"};
  const std::vector<Row> rows = {
      {0, "", simOnly},      {1, "", both},         {2, "", both},         {3, "", simOnly},
      {-1, "", simOnly},     {INT32_MIN, "", simOnly}, {INT32_MAX, "", simOnly},
      // A failed eSE registration builds no SIM instance; neither failure joins.
      {1, "eSE1", {"eSE1"}}, {1, "SIM1", both},     {0, "SIM1", simOnly},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(std::to_string(row.type) + " " + row.failing);
    fake_ese::reset();
    events.clear();
    cap.clear();
    failures.clear();
    if (!row.failing.empty()) failures[row.failing] = ::android::UNKNOWN_ERROR;
    eseRegistered = false;
    simModemId = -1;
    g_korva_exist = 12345;
    fake_ese::setEseType(row.type);

    EXPECT_EQ(qvese_service_main(), 1);

    // The type is stored before anything is registered.
    Events expected;
    for (const auto& name : row.tried) {
      expected.push_back("configure 2 join");
      expected.push_back("register " + name + " type=" + std::to_string(row.type));
    }
    if (row.failing.empty()) expected.push_back("join");
    EXPECT_EQ(events, expected);
    EXPECT_EQ(g_korva_exist, row.type);
    // The only library call of the start-up is the type query.
    EXPECT_EQ(fake_ese::calls(), (Events{"type"}));

    EXPECT_EQ(priorityOf("ecure Element HAL Service 1.0 is starting"), ANDROID_LOG_INFO);
    EXPECT_EQ(priorityOf("g_ese_type = " + std::to_string(row.type) + "!"), ANDROID_LOG_ERROR);
    const bool ese = row.tried.front() == "eSE1", sim = row.tried.back() == "SIM1";
    const auto outcome = [&](const std::string& name, bool tried, bool success) -> int {
      if (!tried || (row.failing == name) == success) return -1;
      return success ? ANDROID_LOG_INFO : ANDROID_LOG_ERROR;
    };
    for (bool success : {true, false}) {
      const char* word = success ? "success" : "fail";
      EXPECT_EQ(priorityOf(std::string("SecureElement Registered eSE1 ") + word),
                outcome("eSE1", ese, success));
      EXPECT_EQ(priorityOf(std::string("ZerbSimSecureElement Registered sim1 ") + word),
                outcome("SIM1", sim, success));
    }
    EXPECT_EQ(cap.contains("eSE1", kTag), ese);
    EXPECT_EQ(eseRegistered, ese);
    EXPECT_EQ(simModemId, sim ? 0 : -1);
    EXPECT_EQ(cap.contains("modemid", "ZerbSimSecureElement"), sim);  // the SIM instance was built
  }
}

}  // namespace

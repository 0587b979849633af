// secli over the AIDL interface: the same commands, with AIDL's statuses.
#include <aidl/android/hardware/secure_element/BnSecureElementCallback.h>
#include <aidl/android/hardware/secure_element/ISecureElement.h>
#include <android/binder_manager.h>
#include <host/aidl_host.h>

#include <chrono>
#include <thread>

#include "secli_lib.h"

namespace secli {

namespace {

using ::aidl::android::hardware::secure_element::BnSecureElementCallback;
using ::aidl::android::hardware::secure_element::LogicalChannelResponse;
using AidlSE = ::aidl::android::hardware::secure_element::ISecureElement;
using ::ndk::ScopedAStatus;

class StateRecorder : public BnSecureElementCallback {
 public:
  ScopedAStatus onStateChange(bool connected, const std::string& reason) override {
    states.push_back(connected);
    reasons.push_back(reason);
    return ScopedAStatus::ok();
  }
  // Only the session's thread runs these calls, while it waits in a call.
  std::vector<bool> states;
  std::vector<std::string> reasons;
};

std::string exceptionName(binder_exception_t e) {
  switch (e) {
    case EX_SECURITY: return "EX_SECURITY";
    case EX_BAD_PARCELABLE: return "EX_BAD_PARCELABLE";
    case EX_ILLEGAL_ARGUMENT: return "EX_ILLEGAL_ARGUMENT";
    case EX_NULL_POINTER: return "EX_NULL_POINTER";
    case EX_ILLEGAL_STATE: return "EX_ILLEGAL_STATE";
    case EX_UNSUPPORTED_OPERATION: return "EX_UNSUPPORTED_OPERATION";
    default: return "EX_" + std::to_string(e);
  }
}

// "SUCCESS", the interface's error name, or the exception's; a transport
// failure goes to r->error instead.
void takeStatus(const ScopedAStatus& st, Result* r) {
  r->aidl = true;
  if (st.isOk()) {
    r->aidlStatus = "SUCCESS";
    return;
  }
  r->aidlMessage = st.getMessage();
  if (st.getExceptionCode() == EX_TRANSACTION_FAILED) {
    r->error = r->aidlMessage.empty() ? st.getDescription() : r->aidlMessage;
    return;
  }
  if (st.getExceptionCode() != EX_SERVICE_SPECIFIC) {
    r->aidlStatus = exceptionName(st.getExceptionCode());
    return;
  }
  const int32_t code = st.getServiceSpecificError();
  if (code >= 1 && code <= 5) {
    r->aidlStatus = toString(static_cast<SecureElementStatus>(code));
  } else {
    r->aidlStatus = "SERVICE_SPECIFIC_" + std::to_string(code);
  }
}

class AidlSessionImpl : public AidlSession {
 public:
  AidlSessionImpl(std::shared_ptr<AidlSE> se, int timeoutMs)
      : mSe(std::move(se)), mTimeoutMs(timeoutMs) {}

  void setChain(bool on) override { mChain = on; }
  void setTrace(FILE* trace) override { mTrace = trace; }

  Result run(const Command& c) override {
    Result r;
    r.kind = c.kind;
    r.cmd = c.name;
    r.aidl = true;
    switch (c.kind) {
      case CommandKind::Init: {
        if (mCallback == nullptr) mCallback = ::ndk::SharedRefBase::make<StateRecorder>();
        const size_t before = mCallback->states.size();
        takeStatus(mSe->init(mCallback), &r);
        if (!r.error.empty() || r.aidlStatus != "SUCCESS") break;
        // The state may come during init or after it.
        auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(mTimeoutMs);
        while (mCallback->states.size() == before) {
          auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                          deadline - std::chrono::steady_clock::now())
                          .count();
          if (left <= 0) break;
          if (::android::host::pollIncomingCalls(mSe->asBinder().get(), static_cast<int>(left)) <
              0) {
            r.error = "connection to the service lost";
            break;
          }
        }
        if (mCallback->states.size() > before) {
          r.state = mCallback->states.back();
          r.reason = mCallback->reasons.back();
        }
        r.waitedSeconds = mTimeoutMs / 1000.0;
        break;
      }
      case CommandKind::Present:
        takeStatus(mSe->isCardPresent(&r.present), &r);
        break;
      case CommandKind::Atr:
        takeStatus(mSe->getAtr(&r.data), &r);
        break;
      case CommandKind::Open: {
        LogicalChannelResponse resp;
        takeStatus(mSe->openLogicalChannel(c.bytes, static_cast<int8_t>(c.p2), &resp), &r);
        r.channel = static_cast<uint8_t>(resp.channelNumber);
        r.data = resp.selectResponse;
        break;
      }
      case CommandKind::Basic:
        takeStatus(mSe->openBasicChannel(c.bytes, static_cast<int8_t>(c.p2), &r.data), &r);
        break;
      case CommandKind::Transmit: {
        // Each exchange's status: the last one is the command's.
        auto send = [&](const std::vector<uint8_t>& apdu) {
          if (!r.error.empty()) return std::vector<uint8_t>();
          std::vector<uint8_t> out;
          trace("> ", apdu);
          takeStatus(mSe->transmit(apdu, &out), &r);
          if (r.aidlStatus != "SUCCESS") out.clear();
          trace("< ", out);
          return out;
        };
        if (mChain) {
          r.data = transmitChained(c.bytes, send, &r.exchanges);
        } else {
          r.data = send(c.bytes);
        }
        break;
      }
      case CommandKind::Close:
        takeStatus(mSe->closeChannel(static_cast<int8_t>(c.channel)), &r);
        break;
      case CommandKind::Reset: {
        const size_t before = mCallback ? mCallback->states.size() : 0;
        takeStatus(mSe->reset(), &r);
        // The service sends both states before reset returns.
        if (mCallback) {
          r.states.assign(mCallback->states.begin() + static_cast<std::ptrdiff_t>(before),
                          mCallback->states.end());
        }
        break;
      }
      case CommandKind::Sleep:
        std::this_thread::sleep_for(std::chrono::milliseconds(c.ms));
        r.ms = c.ms;
        r.aidl = false;
        break;
    }
    return r;
  }

 private:
  void trace(const char* dir, const std::vector<uint8_t>& bytes) {
    if (mTrace == nullptr) return;
    fprintf(mTrace, "secli: trace %s%s\n", dir, bytes.empty() ? "(none)" : hexGrouped(bytes).c_str());
    fflush(mTrace);
  }

  std::shared_ptr<AidlSE> mSe;
  int mTimeoutMs;
  bool mChain = false;
  FILE* mTrace = nullptr;
  std::shared_ptr<StateRecorder> mCallback;
};

}  // namespace

std::string aidlInstanceName(const std::string& instance) {
  return std::string(AidlSE::descriptor) + "/" + instance;
}

std::unique_ptr<AidlSession> AidlSession::connect(const std::string& instance, int timeoutMs) {
  if (instance.empty() || instance.find('/') != std::string::npos) return nullptr;
  ::ndk::SpAIBinder binder(AServiceManager_checkService(aidlInstanceName(instance).c_str()));
  std::shared_ptr<AidlSE> se = AidlSE::fromBinder(binder);
  if (se == nullptr) return nullptr;
  ::android::host::setCallTimeout(binder.get(), timeoutMs);
  return std::make_unique<AidlSessionImpl>(std::move(se), timeoutMs);
}

std::string aidlJsonFields(const Result& r) {
  std::string s = ",\"status\":" + jsonText(r.aidlStatus);
  if (r.aidlStatus != "SUCCESS") {
    if (!r.aidlMessage.empty()) s += ",\"message\":" + jsonText(r.aidlMessage);
    if (r.kind == CommandKind::Reset) {
      s += ",\"states\":[";
      for (size_t i = 0; i < r.states.size(); ++i) s += (i ? "," : "") + std::string(r.states[i] ? "true" : "false");
      s += "]";
    }
    return s;
  }
  switch (r.kind) {
    case CommandKind::Init:
      s += ",\"state\":";
      s += r.state ? (*r.state ? "true" : "false") : "null";
      if (r.reason) s += ",\"reason\":" + jsonText(*r.reason);
      break;
    case CommandKind::Present:
      s += std::string(",\"present\":") + (r.present ? "true" : "false");
      break;
    case CommandKind::Atr:
      s += ",\"atr\":\"" + hexCompact(r.data) + "\"";
      break;
    case CommandKind::Open:
      s += ",\"channel\":" + std::to_string(r.channel) + ",\"select\":\"" + hexCompact(r.data) + "\"";
      break;
    case CommandKind::Basic:
      s += ",\"select\":\"" + hexCompact(r.data) + "\"";
      break;
    case CommandKind::Transmit:
      s += ",\"response\":\"" + hexCompact(r.data) + "\"";
      if (r.exchanges > 1) s += ",\"exchanges\":" + std::to_string(r.exchanges);
      break;
    case CommandKind::Reset:
      s += ",\"states\":[";
      for (size_t i = 0; i < r.states.size(); ++i) s += (i ? "," : "") + std::string(r.states[i] ? "true" : "false");
      s += "]";
      break;
    case CommandKind::Close:
    case CommandKind::Sleep:
      break;
  }
  return s;
}

std::string aidlHumanLine(const Result& r) {
  if (r.aidlStatus != "SUCCESS") {
    return r.aidlStatus + (r.aidlMessage.empty() ? "" : " (" + r.aidlMessage + ")");
  }
  auto withNote = [](const std::string& text, const std::vector<uint8_t>& data) {
    std::string note = statusWordNote(data);
    return note.empty() ? text : text + " " + note;
  };
  switch (r.kind) {
    case CommandKind::Init:
      if (!r.state) return "SUCCESS state=none (no onStateChange)";
      return std::string("SUCCESS state=") + (*r.state ? "true" : "false") + " reason=\"" +
             r.reason.value_or("") + "\"";
    case CommandKind::Present:
      return std::string("SUCCESS present=") + (r.present ? "true" : "false");
    case CommandKind::Atr:
      return r.data.empty() ? "SUCCESS atr=(empty)" : "SUCCESS atr=" + hexGrouped(r.data);
    case CommandKind::Open:
      return withNote("SUCCESS channel=" + std::to_string(r.channel) + " select=" + hexCompact(r.data),
                      r.data);
    case CommandKind::Basic:
      return withNote("SUCCESS select=" + hexCompact(r.data), r.data);
    case CommandKind::Transmit:
      return withNote("SUCCESS " + hexGrouped(r.data), r.data);
    case CommandKind::Reset: {
      std::string s = "SUCCESS states=";
      for (size_t i = 0; i < r.states.size(); ++i) s += (i ? "," : "") + std::string(r.states[i] ? "true" : "false");
      return s;
    }
    case CommandKind::Close:
      return "SUCCESS";
    case CommandKind::Sleep:
      return "";
  }
  return "";
}

}  // namespace secli

#pragma once
// Results of RPC calls: a value plus the transport status that carried it.
#include <string>
#include <utility>

namespace android {
namespace hardware {

class Status {
 public:
  enum Exception {
    EX_NONE = 0,
    EX_ILLEGAL_ARGUMENT = -3,
    EX_ILLEGAL_STATE = -5,
    EX_TRANSACTION_FAILED = -129,
  };
  Status() = default;
  static Status ok() { return Status(); }
  static Status fromExceptionCode(int code, const std::string& message = "") {
    Status s;
    s.mException = code;
    s.mMessage = message;
    return s;
  }
  bool isOk() const { return mException == EX_NONE; }
  int exceptionCode() const { return mException; }
  const std::string& exceptionMessage() const { return mMessage; }
  std::string description() const {
    if (isOk()) return "No error";
    return "Status(" + std::to_string(mException) + "): '" + mMessage + "'";
  }

 private:
  int mException = EX_NONE;
  std::string mMessage;
};

namespace details {
class return_status {
 public:
  return_status() = default;
  return_status(const Status& s) : mStatus(s) {}
  bool isOk() const { return mStatus.isOk(); }
  bool isDeadObject() const { return mStatus.exceptionCode() == Status::EX_TRANSACTION_FAILED; }
  std::string description() const { return mStatus.description(); }
  const Status& getStatus() const { return mStatus; }

 private:
  Status mStatus;
};
}  // namespace details

template <typename T>
class Return : public details::return_status {
 public:
  Return(T v) : details::return_status(), mVal(std::move(v)) {}
  Return(const Status& s) : details::return_status(s), mVal{} {}
  // A failed transport yields the value-initialised T; callers check isOk().
  operator T() const { return mVal; }
  T withDefault(T t) const { return isOk() ? mVal : t; }

 private:
  T mVal;
};

template <>
class Return<void> : public details::return_status {
 public:
  Return() : details::return_status() {}
  Return(const Status& s) : details::return_status(s) {}
};

inline Return<void> Void() { return Return<void>(); }

}  // namespace hardware
}  // namespace android

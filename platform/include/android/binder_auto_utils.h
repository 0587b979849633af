#pragma once
// Host stand-in for the NDK's owning wrappers of binder handles.
#include <string>
#include <utility>

#include <android/binder_ibinder.h>
#include <android/binder_status.h>

namespace ndk {

// Owns one strong reference to an AIBinder.
class SpAIBinder {
 public:
  SpAIBinder() = default;
  // Takes over a reference the caller already holds.
  explicit SpAIBinder(AIBinder* binder) : mBinder(binder) {}
  SpAIBinder(std::nullptr_t) {}
  SpAIBinder(const SpAIBinder& other) : mBinder(other.mBinder) {
    if (mBinder != nullptr) AIBinder_incStrong(mBinder);
  }
  SpAIBinder(SpAIBinder&& other) noexcept : mBinder(other.release()) {}
  SpAIBinder& operator=(const SpAIBinder& other) {
    if (this != &other) {
      if (other.mBinder != nullptr) AIBinder_incStrong(other.mBinder);
      set(other.mBinder);
    }
    return *this;
  }
  SpAIBinder& operator=(SpAIBinder&& other) noexcept {
    if (this != &other) set(other.release());
    return *this;
  }
  ~SpAIBinder() { set(nullptr); }

  AIBinder* get() const { return mBinder; }
  AIBinder* release() { return std::exchange(mBinder, nullptr); }
  // Takes over `binder` (already referenced) and drops the old one.
  void set(AIBinder* binder) {
    AIBinder* old = std::exchange(mBinder, binder);
    if (old != nullptr) AIBinder_decStrong(old);
  }
  bool operator==(const SpAIBinder& o) const { return mBinder == o.mBinder; }
  bool operator!=(const SpAIBinder& o) const { return mBinder != o.mBinder; }

 private:
  AIBinder* mBinder = nullptr;
};

// Owns one weak reference.
class ScopedAIBinder_Weak {
 public:
  ScopedAIBinder_Weak() = default;
  explicit ScopedAIBinder_Weak(AIBinder_Weak* weak) : mWeak(weak) {}
  ScopedAIBinder_Weak(const ScopedAIBinder_Weak&) = delete;
  ScopedAIBinder_Weak& operator=(const ScopedAIBinder_Weak&) = delete;
  ~ScopedAIBinder_Weak() { set(nullptr); }
  AIBinder_Weak* get() const { return mWeak; }
  void set(AIBinder_Weak* weak) {
    AIBinder_Weak* old = std::exchange(mWeak, weak);
    if (old != nullptr) AIBinder_Weak_delete(old);
  }
  SpAIBinder promote() const {
    return SpAIBinder(mWeak != nullptr ? AIBinder_Weak_promote(mWeak) : nullptr);
  }

 private:
  AIBinder_Weak* mWeak = nullptr;
};

// Owns a death recipient; deleting it ends its notices.
class ScopedAIBinder_DeathRecipient {
 public:
  ScopedAIBinder_DeathRecipient() = default;
  explicit ScopedAIBinder_DeathRecipient(AIBinder_DeathRecipient* r) : mRecipient(r) {}
  ScopedAIBinder_DeathRecipient(ScopedAIBinder_DeathRecipient&& o) noexcept
      : mRecipient(std::exchange(o.mRecipient, nullptr)) {}
  ScopedAIBinder_DeathRecipient& operator=(ScopedAIBinder_DeathRecipient&& o) noexcept {
    if (this != &o) set(std::exchange(o.mRecipient, nullptr));
    return *this;
  }
  ScopedAIBinder_DeathRecipient(const ScopedAIBinder_DeathRecipient&) = delete;
  ScopedAIBinder_DeathRecipient& operator=(const ScopedAIBinder_DeathRecipient&) = delete;
  ~ScopedAIBinder_DeathRecipient() { set(nullptr); }
  AIBinder_DeathRecipient* get() const { return mRecipient; }
  void set(AIBinder_DeathRecipient* r) {
    AIBinder_DeathRecipient* old = std::exchange(mRecipient, r);
    if (old != nullptr) AIBinder_DeathRecipient_delete(old);
  }

 private:
  AIBinder_DeathRecipient* mRecipient = nullptr;
};

// Owns an AStatus: the outcome of one call.
class ScopedAStatus {
 public:
  ScopedAStatus() : mStatus(AStatus_newOk()) {}
  explicit ScopedAStatus(AStatus* status) : mStatus(status) {}
  ScopedAStatus(ScopedAStatus&& o) noexcept : mStatus(std::exchange(o.mStatus, nullptr)) {}
  ScopedAStatus& operator=(ScopedAStatus&& o) noexcept {
    if (this != &o) set(std::exchange(o.mStatus, nullptr));
    return *this;
  }
  ScopedAStatus(const ScopedAStatus&) = delete;
  ScopedAStatus& operator=(const ScopedAStatus&) = delete;
  ~ScopedAStatus() { set(nullptr); }

  static ScopedAStatus ok() { return ScopedAStatus(AStatus_newOk()); }
  static ScopedAStatus fromExceptionCode(binder_exception_t e) {
    return ScopedAStatus(AStatus_fromExceptionCode(e));
  }
  static ScopedAStatus fromExceptionCodeWithMessage(binder_exception_t e, const char* message) {
    return ScopedAStatus(AStatus_fromExceptionCodeWithMessage(e, message));
  }
  static ScopedAStatus fromServiceSpecificError(int32_t code) {
    return ScopedAStatus(AStatus_fromServiceSpecificError(code));
  }
  static ScopedAStatus fromServiceSpecificErrorWithMessage(int32_t code, const char* message) {
    return ScopedAStatus(AStatus_fromServiceSpecificErrorWithMessage(code, message));
  }
  static ScopedAStatus fromStatus(binder_status_t status) {
    return ScopedAStatus(AStatus_fromStatus(status));
  }

  bool isOk() const { return mStatus == nullptr || AStatus_isOk(mStatus); }
  binder_exception_t getExceptionCode() const {
    return mStatus ? AStatus_getExceptionCode(mStatus) : EX_NONE;
  }
  int32_t getServiceSpecificError() const {
    return mStatus ? AStatus_getServiceSpecificError(mStatus) : 0;
  }
  binder_status_t getStatus() const { return mStatus ? AStatus_getStatus(mStatus) : STATUS_OK; }
  const char* getMessage() const { return mStatus ? AStatus_getMessage(mStatus) : ""; }
  std::string getDescription() const {
    if (mStatus == nullptr) return "No error";
    const char* d = AStatus_getDescription(mStatus);
    std::string out = d;
    AStatus_deleteDescription(d);
    return out;
  }
  AStatus* get() const { return mStatus; }

 private:
  void set(AStatus* s) {
    AStatus* old = std::exchange(mStatus, s);
    if (old != nullptr) AStatus_delete(old);
  }
  AStatus* mStatus = nullptr;
};

}  // namespace ndk

#pragma once
// A small scripted ISecureElement for tests of the RPC host and of secli. It
// records the arguments it saw and answers predictably:
//   getAtr        -> kFakeAtr
//   isCardPresent -> `present`
//   transmit(x)   -> x followed by 90 00
//   openLogical   -> next channel (1, 2, ...), select = 6F 0A <aid> 90 00;
//                    an AID starting with FF gives NO_SUCH_ELEMENT_ERROR
//   openBasic     -> select = <aid> <p2> 90 00, SUCCESS
//   closeChannel  -> SUCCESS for an open channel, FAILED otherwise
//   init(cb)      -> links to the callback's death (cookie 0) and, unless
//                    deferred, calls onStateChange(true) before returning
// init and every death notice record the calling pid the host reports.
#include <android/hardware/secure_element/1.0/ISecureElement.h>
#include <hwbinder/IPCThreadState.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <set>
#include <vector>

namespace fake {

using ::android::sp;
using ::android::wp;
using ::android::hardware::hidl_death_recipient;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::Void;
using ::android::hardware::secure_element::V1_0::ISecureElement;
using ::android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using ::android::hardware::secure_element::V1_0::LogicalChannelResponse;
using ::android::hardware::secure_element::V1_0::SecureElementStatus;
using ::android::hidl::base::V1_0::IBase;

inline const std::vector<uint8_t> kFakeAtr = {0x3B, 0x8F, 0x80, 0x01, 0x80, 0x4F, 0x0C, 0xA0,
                                              0x00, 0x00, 0x03, 0x06, 0x03, 0x00, 0x01, 0x6A};

// Waits on a condition with a generous limit, so a broken build fails
// instead of hanging.
constexpr auto kWaitLimit = std::chrono::seconds(10);

class DeathWatcher : public hidl_death_recipient {
 public:
  void serviceDied(uint64_t cookie, const wp<IBase>& who) override {
    std::lock_guard<std::mutex> g(mLock);
    mPids.push_back(::android::hardware::IPCThreadState::self()->getCallingPid());
    mCookies.push_back(cookie);
    mLastWho = who;
    mCv.notify_all();
  }
  bool waitDeaths(size_t n) {
    std::unique_lock<std::mutex> lk(mLock);
    return mCv.wait_for(lk, kWaitLimit, [&] { return mCookies.size() >= n; });
  }
  std::vector<uint64_t> cookies() {
    std::lock_guard<std::mutex> g(mLock);
    return mCookies;
  }
  wp<IBase> lastWho() {
    std::lock_guard<std::mutex> g(mLock);
    return mLastWho;
  }
  std::vector<pid_t> pids() {
    std::lock_guard<std::mutex> g(mLock);
    return mPids;
  }

 private:
  std::mutex mLock;
  std::condition_variable mCv;
  std::vector<uint64_t> mCookies;
  std::vector<pid_t> mPids;
  wp<IBase> mLastWho;
};

class FakeSecureElement : public ISecureElement {
 public:
  // Knobs, set before calls are made.
  std::atomic<bool> present{true};
  std::atomic<bool> deferStateChange{false};  // init returns without onStateChange
  std::atomic<bool> skipResult{false};        // result callbacks are not called
  std::atomic<bool> doubleResult{false};      // result callbacks are called twice
  std::atomic<bool> blockTransmit{false};     // transmit waits for release()

  sp<DeathWatcher> watcher = new DeathWatcher();

  Return<void> init(const sp<ISecureElementHalCallback>& cb) override {
    {
      std::lock_guard<std::mutex> g(mLock);
      mCallback = cb;
      mInitPids.push_back(::android::hardware::IPCThreadState::self()->getCallingPid());
      ++mInits;
      mCv.notify_all();
    }
    if (cb != nullptr) {
      cb->linkToDeath(watcher, 0);
      if (!deferStateChange) cb->onStateChange(true);
    }
    return Void();
  }

  Return<void> getAtr(getAtr_cb cb) override {
    if (!skipResult) cb(kFakeAtr);
    if (doubleResult) cb(hidl_vec<uint8_t>{0xEE});
    return Void();
  }

  Return<bool> isCardPresent() override { return present.load(); }

  Return<void> transmit(const hidl_vec<uint8_t>& data, transmit_cb cb) override {
    {
      std::unique_lock<std::mutex> lk(mLock);
      mLastTransmit = data;
      ++mRunning;
      ++mEntered;
      if (mRunning > mMaxRunning) mMaxRunning = mRunning;
      mCv.notify_all();
      if (blockTransmit) mCv.wait(lk, [&] { return mReleases > 0; });
      if (blockTransmit) --mReleases;
      --mRunning;
    }
    std::vector<uint8_t> resp(data.begin(), data.end());
    resp.push_back(0x90);
    resp.push_back(0x00);
    if (!skipResult) cb(resp);
    if (doubleResult) cb(hidl_vec<uint8_t>{0x6F, 0x00});
    return Void();
  }

  Return<void> openLogicalChannel(const hidl_vec<uint8_t>& aid, uint8_t p2,
                                  openLogicalChannel_cb cb) override {
    LogicalChannelResponse resp;
    SecureElementStatus status = SecureElementStatus::SUCCESS;
    {
      std::lock_guard<std::mutex> g(mLock);
      mLastAid = aid;
      mLastP2 = p2;
      if (aid.size() > 0 && aid[0] == 0xFF) {
        status = SecureElementStatus::NO_SUCH_ELEMENT_ERROR;
      } else {
        resp.channelNumber = ++mNextChannel;
        mOpen.insert(resp.channelNumber);
        std::vector<uint8_t> sel = {0x6F, 0x0A};
        sel.insert(sel.end(), aid.begin(), aid.end());
        sel.push_back(0x90);
        sel.push_back(0x00);
        resp.selectResponse = sel;
      }
    }
    if (!skipResult) cb(resp, status);
    return Void();
  }

  Return<void> openBasicChannel(const hidl_vec<uint8_t>& aid, uint8_t p2,
                                openBasicChannel_cb cb) override {
    std::vector<uint8_t> sel(aid.begin(), aid.end());
    {
      std::lock_guard<std::mutex> g(mLock);
      mLastAid = aid;
      mLastP2 = p2;
    }
    sel.push_back(p2);
    sel.push_back(0x90);
    sel.push_back(0x00);
    if (!skipResult) cb(sel, SecureElementStatus::SUCCESS);
    return Void();
  }

  Return<SecureElementStatus> closeChannel(uint8_t channel) override {
    std::lock_guard<std::mutex> g(mLock);
    mLastClose = channel;
    return mOpen.erase(channel) ? SecureElementStatus::SUCCESS : SecureElementStatus::FAILED;
  }

  // Test side.
  void release(int n = 1) {
    std::lock_guard<std::mutex> g(mLock);
    mReleases += n;
    mCv.notify_all();
  }
  // True if `n` calls entered within `window`; for checking that one does not.
  bool enteredWithin(int n, std::chrono::milliseconds window) {
    std::unique_lock<std::mutex> lk(mLock);
    return mCv.wait_for(lk, window, [&] { return mEntered >= n; });
  }
  bool waitEntered(int n) { return enteredWithin(n, kWaitLimit); }
  bool waitInit(int n = 1) {
    std::unique_lock<std::mutex> lk(mLock);
    return mCv.wait_for(lk, kWaitLimit, [&] { return mInits >= n; });
  }
  std::vector<pid_t> initPids() { return locked(mInitPids); }
  sp<ISecureElementHalCallback> callback() { return locked(mCallback); }
  int maxRunning() { return locked(mMaxRunning); }
  std::vector<uint8_t> lastTransmit() { return locked(mLastTransmit); }
  std::vector<uint8_t> lastAid() { return locked(mLastAid); }
  uint8_t lastP2() { return locked(mLastP2); }
  uint8_t lastClose() { return locked(mLastClose); }
 private:
  template <typename T>
  T locked(const T& field) {
    std::lock_guard<std::mutex> g(mLock);
    return field;
  }

  std::mutex mLock;
  std::condition_variable mCv;
  sp<ISecureElementHalCallback> mCallback;
  int mInits = 0;
  std::vector<pid_t> mInitPids;
  int mRunning = 0, mMaxRunning = 0, mEntered = 0, mReleases = 0;
  uint8_t mNextChannel = 0;
  std::set<uint8_t> mOpen;
  std::vector<uint8_t> mLastTransmit, mLastAid;
  uint8_t mLastP2 = 0, mLastClose = 0;
};

}  // namespace fake

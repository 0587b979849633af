#include <utils/RefBase.h>

#include <atomic>

namespace android {

namespace {
constexpr int32_t kInitialStrong = 1 << 28;
}

class RefBase::weakref_impl : public RefBase::weakref_type {
 public:
  explicit weakref_impl(RefBase* base) : mStrong(kInitialStrong), mWeak(0), mBase(base) {}
  std::atomic<int32_t> mStrong;
  std::atomic<int32_t> mWeak;
  RefBase* const mBase;
};

RefBase::RefBase() : mRefs(new weakref_impl(this)) {}

RefBase::~RefBase() {
  // Weak references outlive the object and free the bookkeeping themselves;
  // an object that never had a strong reference frees it here.
  if (mRefs->mWeak.load() == 0) delete mRefs;
}

void RefBase::onFirstRef() {}
void RefBase::onLastStrongRef(const void*) {}

void RefBase::incStrong(const void* id) const {
  mRefs->incWeak(id);
  int32_t c = mRefs->mStrong.fetch_add(1, std::memory_order_relaxed);
  if (c != kInitialStrong) return;
  mRefs->mStrong.fetch_sub(kInitialStrong, std::memory_order_relaxed);
  const_cast<RefBase*>(this)->onFirstRef();
}

void RefBase::decStrong(const void* id) const {
  weakref_impl* refs = mRefs;
  // acq_rel on the decrement itself rather than a separate acquire fence:
  // the thread sanitizer does not model stand-alone fences.
  int32_t c = refs->mStrong.fetch_sub(1, std::memory_order_acq_rel);
  if (c == 1) {
    const_cast<RefBase*>(this)->onLastStrongRef(id);
    delete this;
  }
  refs->decWeak(id);
}

int32_t RefBase::getStrongCount() const { return mRefs->mStrong.load(std::memory_order_relaxed); }

RefBase::weakref_type* RefBase::createWeak(const void* id) const {
  mRefs->incWeak(id);
  return mRefs;
}

RefBase::weakref_type* RefBase::getWeakRefs() const { return mRefs; }

RefBase* RefBase::weakref_type::refBase() const {
  return static_cast<const weakref_impl*>(this)->mBase;
}

void RefBase::weakref_type::incWeak(const void*) {
  static_cast<weakref_impl*>(this)->mWeak.fetch_add(1, std::memory_order_relaxed);
}

void RefBase::weakref_type::decWeak(const void*) {
  auto* impl = static_cast<weakref_impl*>(this);
  int32_t c = impl->mWeak.fetch_sub(1, std::memory_order_acq_rel);
  if (c != 1) return;
  int32_t strong = impl->mStrong.load(std::memory_order_relaxed);
  // The object is gone (strong reached zero) or was never strongly held and
  // its last weak reference goes now: in both cases nothing else owns the
  // bookkeeping. An object never strongly held is not deleted here; its own
  // destructor sees no weak references left and frees the bookkeeping.
  if (strong == 0) delete impl;
}

bool RefBase::weakref_type::attemptIncStrong(const void* id) {
  auto* impl = static_cast<weakref_impl*>(this);
  incWeak(id);
  int32_t cur = impl->mStrong.load(std::memory_order_relaxed);
  while (cur > 0 && cur != kInitialStrong) {
    if (impl->mStrong.compare_exchange_weak(cur, cur + 1, std::memory_order_relaxed)) return true;
  }
  decWeak(id);
  return false;
}

}  // namespace android

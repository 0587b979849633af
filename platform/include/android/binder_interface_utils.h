#pragma once
// Host stand-in for the NDK's interface base classes: shared ownership of
// interface objects, and the local (Bn) and proxy (Bp) halves of an
// interface over an AIBinder.
#include <memory>
#include <mutex>
#include <utility>

#include <android/binder_auto_utils.h>

namespace ndk {

// Objects owned by std::shared_ptr and able to hand out further owners of
// themselves. Made only through make<T>().
class SharedRefBase {
 public:
  SharedRefBase() = default;
  virtual ~SharedRefBase() = default;
  SharedRefBase(const SharedRefBase&) = delete;
  SharedRefBase& operator=(const SharedRefBase&) = delete;

  template <class T>
  std::shared_ptr<T> ref() {
    std::shared_ptr<SharedRefBase> self;
    std::call_once(mFlagThis, [&] {
      self = std::shared_ptr<SharedRefBase>(this);
      mThis = self;
    });
    if (self == nullptr) self = mThis.lock();
    return std::static_pointer_cast<T>(self);
  }

  template <class T, class... Args>
  static std::shared_ptr<T> make(Args&&... args) {
    std::unique_ptr<T> owner(new T(std::forward<Args>(args)...));
    T* t = owner.release();
    return t->template ref<T>();
  }

 private:
  std::once_flag mFlagThis;
  std::weak_ptr<SharedRefBase> mThis;
};

class ICInterface : public SharedRefBase {
 public:
  virtual SpAIBinder asBinder() = 0;
  virtual bool isRemote() = 0;
};

// The local half: hands out one binder at a time for this object; the binder
// keeps the object alive, the object only remembers the binder weakly.
template <typename INTERFACE>
class BnCInterface : public INTERFACE {
 public:
  SpAIBinder asBinder() override final {
    std::lock_guard<std::mutex> g(mMutex);
    SpAIBinder binder = mWeakBinder.promote();
    if (binder.get() == nullptr) {
      binder = createBinder();
      mWeakBinder.set(AIBinder_Weak_new(binder.get()));
    }
    return binder;
  }
  bool isRemote() override final { return false; }

 protected:
  virtual SpAIBinder createBinder() = 0;

 private:
  std::mutex mMutex;
  ScopedAIBinder_Weak mWeakBinder;
};

// The proxy half: calls travel over the binder.
template <typename INTERFACE>
class BpCInterface : public INTERFACE {
 public:
  explicit BpCInterface(const SpAIBinder& binder) : mBinder(binder) {}
  SpAIBinder asBinder() override final { return mBinder; }
  bool isRemote() override final { return AIBinder_isRemote(mBinder.get()); }

 private:
  SpAIBinder mBinder;
};

}  // namespace ndk

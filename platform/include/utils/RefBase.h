#pragma once
// Intrusive reference counting with strong and weak references, as the
// platform's RefBase: the object dies with its last strong reference, the
// bookkeeping with its last weak one.
#include <cstdint>
#include <utils/StrongPointer.h>

namespace android {

class RefBase {
 public:
  void incStrong(const void* id) const;
  void decStrong(const void* id) const;
  int32_t getStrongCount() const;

  class weakref_type {
   public:
    RefBase* refBase() const;
    void incWeak(const void* id);
    void decWeak(const void* id);
    // Takes a strong reference only while the object is still alive.
    bool attemptIncStrong(const void* id);
  };

  weakref_type* createWeak(const void* id) const;
  weakref_type* getWeakRefs() const;

 protected:
  RefBase();
  virtual ~RefBase();
  virtual void onFirstRef();
  virtual void onLastStrongRef(const void* id);

 private:
  RefBase(const RefBase&) = delete;
  RefBase& operator=(const RefBase&) = delete;
  class weakref_impl;
  weakref_impl* const mRefs;
};

template <typename T>
class wp {
 public:
  wp() : m_ptr(nullptr), m_refs(nullptr) {}
  wp(T* other) : m_ptr(other), m_refs(other ? other->createWeak(this) : nullptr) {}
  wp(const wp<T>& other) : m_ptr(other.m_ptr), m_refs(other.m_refs) {
    if (m_ptr) m_refs->incWeak(this);
  }
  wp(const sp<T>& other) : wp(other.get()) {}
  template <typename U>
  wp(const sp<U>& other) : wp(static_cast<T*>(other.get())) {}
  ~wp() {
    if (m_ptr) m_refs->decWeak(this);
  }
  wp& operator=(const wp<T>& other) {
    if (other.m_ptr) other.m_refs->incWeak(this);
    if (m_ptr) m_refs->decWeak(this);
    m_ptr = other.m_ptr;
    m_refs = other.m_refs;
    return *this;
  }
  wp& operator=(const sp<T>& other) { return *this = wp<T>(other); }

  sp<T> promote() const {
    sp<T> result;
    if (m_ptr && m_refs->attemptIncStrong(&result)) result.set_pointer(m_ptr);
    return result;
  }
  void clear() { *this = wp<T>(); }
  T* unsafe_get() const { return m_ptr; }
  bool operator==(const wp<T>& o) const { return m_ptr == o.m_ptr; }
  bool operator!=(const wp<T>& o) const { return m_ptr != o.m_ptr; }

 private:
  T* m_ptr;
  RefBase::weakref_type* m_refs;
};

}  // namespace android

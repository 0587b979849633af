#pragma once
#include <cstddef>
#include <utility>

namespace android {

template <typename T>
class wp;

template <typename T>
class sp {
 public:
  sp() : m_ptr(nullptr) {}
  sp(std::nullptr_t) : m_ptr(nullptr) {}
  sp(T* other) : m_ptr(other) {
    if (m_ptr) m_ptr->incStrong(this);
  }
  sp(const sp<T>& other) : m_ptr(other.m_ptr) {
    if (m_ptr) m_ptr->incStrong(this);
  }
  sp(sp<T>&& other) noexcept : m_ptr(other.m_ptr) { other.m_ptr = nullptr; }
  template <typename U>
  sp(U* other) : m_ptr(other) {
    if (m_ptr) m_ptr->incStrong(this);
  }
  template <typename U>
  sp(const sp<U>& other) : m_ptr(other.get()) {
    if (m_ptr) m_ptr->incStrong(this);
  }
  template <typename U>
  sp(sp<U>&& other) : m_ptr(other.get()) {
    other.set_pointer(nullptr);
  }
  ~sp() {
    if (m_ptr) m_ptr->decStrong(this);
  }

  sp& operator=(const sp<T>& other) {
    T* old = m_ptr;
    if (other.m_ptr) other.m_ptr->incStrong(this);
    m_ptr = other.m_ptr;
    if (old) old->decStrong(this);
    return *this;
  }
  sp& operator=(sp<T>&& other) noexcept {
    if (this != &other) {
      T* old = m_ptr;
      m_ptr = other.m_ptr;
      other.m_ptr = nullptr;
      if (old) old->decStrong(this);
    }
    return *this;
  }
  sp& operator=(T* other) { return *this = sp<T>(other); }
  sp& operator=(std::nullptr_t) {
    clear();
    return *this;
  }
  template <typename U>
  sp& operator=(const sp<U>& other) {
    return *this = sp<T>(other);
  }

  void clear() {
    T* old = m_ptr;
    m_ptr = nullptr;
    if (old) old->decStrong(this);
  }

  T& operator*() const { return *m_ptr; }
  T* operator->() const { return m_ptr; }
  T* get() const { return m_ptr; }
  explicit operator bool() const { return m_ptr != nullptr; }

  bool operator==(std::nullptr_t) const { return m_ptr == nullptr; }
  bool operator!=(std::nullptr_t) const { return m_ptr != nullptr; }
  template <typename U>
  bool operator==(const sp<U>& o) const { return m_ptr == o.get(); }
  template <typename U>
  bool operator!=(const sp<U>& o) const { return m_ptr != o.get(); }

  // For wp<T>::promote and the move constructor across types; takes no reference.
  void set_pointer(T* ptr) { m_ptr = ptr; }

  template <typename... Args>
  static sp<T> make(Args&&... args) {
    return sp<T>(new T(std::forward<Args>(args)...));
  }

 private:
  T* m_ptr;
};

}  // namespace android

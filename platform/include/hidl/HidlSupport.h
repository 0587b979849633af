#pragma once
// Host stand-in for the platform's HIDL support types.
#include <cstdint>
#include <initializer_list>
#include <string>
#include <vector>

#include <hidl/Status.h>
#include <utils/Errors.h>
#include <utils/RefBase.h>

namespace android {
namespace hidl {
namespace base {
namespace V1_0 {
struct IBase;
}
}  // namespace base
}  // namespace hidl

namespace hardware {

// Owned buffer with a 32-bit element count.
template <typename T>
class hidl_vec {
 public:
  hidl_vec() = default;
  hidl_vec(size_t n) : mData(n) {}
  hidl_vec(std::initializer_list<T> l) : mData(l) {}
  hidl_vec(const std::vector<T>& v) : mData(v) {}
  hidl_vec(std::vector<T>&& v) : mData(std::move(v)) {}
  template <typename It>
  hidl_vec(It begin, It end) : mData(begin, end) {}

  hidl_vec& operator=(const std::vector<T>& v) {
    mData = v;
    return *this;
  }
  operator std::vector<T>() const { return mData; }

  // Copies `size` elements; the platform's version can borrow, this one always owns.
  void setToExternal(T* data, size_t size) { mData.assign(data, data + size); }

  size_t size() const { return mData.size(); }
  void resize(size_t n) { mData.resize(n); }
  T* data() { return mData.data(); }
  const T* data() const { return mData.data(); }
  T& operator[](size_t i) { return mData[i]; }
  const T& operator[](size_t i) const { return mData[i]; }
  T* begin() { return mData.data(); }
  T* end() { return mData.data() + mData.size(); }
  const T* begin() const { return mData.data(); }
  const T* end() const { return mData.data() + mData.size(); }
  bool operator==(const hidl_vec<T>& o) const { return mData == o.mData; }
  bool operator!=(const hidl_vec<T>& o) const { return mData != o.mData; }

 private:
  std::vector<T> mData;
};

using hidl_string = std::string;

struct hidl_death_recipient : virtual public RefBase {
  virtual void serviceDied(uint64_t cookie, const wp<::android::hidl::base::V1_0::IBase>& who) = 0;
};

}  // namespace hardware
}  // namespace android

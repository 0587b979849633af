#include <securec.h>

#include <cerrno>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <cstring>

namespace {
bool overlaps(const void* a, size_t n, const void* b, size_t m) {
  auto pa = reinterpret_cast<uintptr_t>(a);
  auto pb = reinterpret_cast<uintptr_t>(b);
  return pa < pb + m && pb < pa + n;
}
}  // namespace

extern "C" errno_t memset_s(void* dest, size_t destMax, int c, size_t count) {
  if (dest == nullptr) return EINVAL;
  if (count > destMax) return ERANGE;
  memset(dest, c, count);
  return EOK;
}

extern "C" errno_t memcpy_s(void* dest, size_t destMax, const void* src, size_t count) {
  if (dest == nullptr) return EINVAL;
  if (count == 0) return EOK;
  if (src == nullptr) return EINVAL;
  if (count > destMax) return ERANGE;
  if (overlaps(dest, count, src, count)) return EINVAL;
  memcpy(dest, src, count);
  return EOK;
}

extern "C" errno_t memmove_s(void* dest, size_t destMax, const void* src, size_t count) {
  if (dest == nullptr) return EINVAL;
  if (count == 0) return EOK;
  if (src == nullptr) return EINVAL;
  if (count > destMax) return ERANGE;
  memmove(dest, src, count);
  return EOK;
}

extern "C" int snprintf_s(char* strDest, size_t destMax, size_t count, const char* format, ...) {
  if (strDest == nullptr || destMax == 0 || format == nullptr) return -1;
  size_t limit = count < destMax - 1 ? count : destMax - 1;
  va_list ap;
  va_start(ap, format);
  int n = vsnprintf(strDest, limit + 1, format, ap);
  va_end(ap);
  if (n < 0) {
    strDest[0] = '\0';
    return -1;
  }
  if (static_cast<size_t>(n) > limit) return -1;
  return n;
}

extern "C" int sprintf_s(char* strDest, size_t destMax, const char* format, ...) {
  if (strDest == nullptr || destMax == 0 || format == nullptr) return -1;
  va_list ap;
  va_start(ap, format);
  int n = vsnprintf(strDest, destMax, format, ap);
  va_end(ap);
  if (n < 0 || static_cast<size_t>(n) >= destMax) {
    strDest[0] = '\0';
    return -1;
  }
  return n;
}

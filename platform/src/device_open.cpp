// Resolves the absolute paths that the daemon's own code opens with open()
// under the device root. Linked only into programs that run daemon code;
// library-internal opens (stdio, the loader) are not affected.
#include <host/device_root.h>

#include <fcntl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdarg>
#include <string>

namespace {
int openMapped(const char* path, int flags, va_list ap) {
  mode_t mode = 0;
  if (flags & (O_CREAT | O_TMPFILE)) mode = static_cast<mode_t>(va_arg(ap, int));
  std::string mapped = path ? android::host::mapDevicePath(path) : std::string();
  return static_cast<int>(
      syscall(SYS_openat, AT_FDCWD, path ? mapped.c_str() : nullptr, flags, mode));
}
}  // namespace

extern "C" int open(const char* path, int flags, ...) {
  va_list ap;
  va_start(ap, flags);
  int fd = openMapped(path, flags, ap);
  va_end(ap);
  return fd;
}

extern "C" int open64(const char* path, int flags, ...) {
  va_list ap;
  va_start(ap, flags);
  int fd = openMapped(path, flags, ap);
  va_end(ap);
  return fd;
}

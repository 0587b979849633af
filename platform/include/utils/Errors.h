#pragma once
#include <cstdint>
#include <cerrno>

namespace android {
using status_t = int32_t;
enum {
  OK = 0,
  NO_ERROR = OK,
  UNKNOWN_ERROR = INT32_MIN,
  NO_MEMORY = -ENOMEM,
  INVALID_OPERATION = -ENOSYS,
  BAD_VALUE = -EINVAL,
  NAME_NOT_FOUND = -ENOENT,
  PERMISSION_DENIED = -EPERM,
  DEAD_OBJECT = -EPIPE,
  FAILED_TRANSACTION = UNKNOWN_ERROR + 2,
  TIMED_OUT = -ETIMEDOUT,
};
}  // namespace android

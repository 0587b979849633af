#pragma once
// Host stand-in for the platform's per-thread HIDL call state: who the
// incoming call that this thread serves comes from.
#include <sys/types.h>

namespace android {
namespace hardware {

class IPCThreadState {
 public:
  // The calling thread's state; never null.
  static IPCThreadState* self();
  // The client process of the call this thread serves (or whose death
  // notice it runs); outside of one, this process itself.
  pid_t getCallingPid() const;
  uid_t getCallingUid() const;

 private:
  IPCThreadState() = default;
};

}  // namespace hardware
}  // namespace android

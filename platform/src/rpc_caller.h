#pragma once
// Which client the current thread works for: set by the host while a pool
// thread runs a client's call or that client's death notice, and read by
// the platform's calling-identity calls.
#include <sys/types.h>

namespace android {
namespace host {
namespace rpc {

class CallerScope {
 public:
  CallerScope(pid_t pid, uid_t uid);
  ~CallerScope();
  CallerScope(const CallerScope&) = delete;
  CallerScope& operator=(const CallerScope&) = delete;

 private:
  bool mOuterSet;
  pid_t mOuterPid;
  uid_t mOuterUid;
};

// The client set by the innermost CallerScope of this thread; this process
// itself outside of any.
pid_t callingPid();
uid_t callingUid();

}  // namespace rpc
}  // namespace host
}  // namespace android

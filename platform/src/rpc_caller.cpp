// The calling identity: peer credentials of the connection whose call (or
// death notice) the thread runs, taken once when the connection is accepted.
#include "rpc_caller.h"

#include <android/binder_ibinder.h>
#include <hwbinder/IPCThreadState.h>

#include <unistd.h>

namespace android {
namespace host {
namespace rpc {

namespace {
struct Caller {
  bool set = false;
  pid_t pid = 0;
  uid_t uid = 0;
};
thread_local Caller t_caller;
}  // namespace

CallerScope::CallerScope(pid_t pid, uid_t uid)
    : mOuterSet(t_caller.set), mOuterPid(t_caller.pid), mOuterUid(t_caller.uid) {
  t_caller = Caller{true, pid, uid};
}

CallerScope::~CallerScope() { t_caller = Caller{mOuterSet, mOuterPid, mOuterUid}; }

pid_t callingPid() { return t_caller.set ? t_caller.pid : getpid(); }

uid_t callingUid() { return t_caller.set ? t_caller.uid : getuid(); }

}  // namespace rpc
}  // namespace host

namespace hardware {

IPCThreadState* IPCThreadState::self() {
  // Stateless: what it reports is the thread's own CallerScope.
  static IPCThreadState state;
  return &state;
}

pid_t IPCThreadState::getCallingPid() const { return host::rpc::callingPid(); }

uid_t IPCThreadState::getCallingUid() const { return host::rpc::callingUid(); }

}  // namespace hardware
}  // namespace android

extern "C" {

pid_t AIBinder_getCallingPid() { return ::android::host::rpc::callingPid(); }

uid_t AIBinder_getCallingUid() { return ::android::host::rpc::callingUid(); }

}  // extern "C"

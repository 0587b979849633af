#pragma once
// Test seam of the RPC host: lets an in-process test stand in for the service
// registry and the thread pool, so the start-up can be driven without sockets.
#include <cstddef>
#include <functional>
#include <string>

#include <android/hidl/base/1.0/IBase.h>
#include <utils/Errors.h>

namespace android {
namespace host {

struct RpcHooks {
  // Called by every registerAsService(); its status is what the caller sees.
  std::function<status_t(const std::string& descriptor, const std::string& name,
                         const sp<hidl::base::V1_0::IBase>& service)>
      registerService;
  std::function<void(size_t maxThreads, bool callerWillJoin)> configureThreadpool;
  // Called by joinRpcThreadpool(); returning from it returns from the join.
  std::function<void()> joinThreadpool;
};

// Installs hooks (not owned; must outlive their use); nullptr restores the real host.
void setRpcHooks(RpcHooks* hooks);

}  // namespace host
}  // namespace android

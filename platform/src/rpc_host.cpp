// Generic RPC transport over Unix-domain stream sockets: registration of
// instances (rpc_listen.cpp), the server's pool (rpc_pool.cpp: its threads
// take turns reading and run the calls they read), server connections with
// their death links (rpc_server_conn.h), and the client connection
// (rpc_client.cpp). Knows frames and object ids, not the interfaces carried
// over them. Here: the hooks and the thread pool calls of the platform.
#include "rpc_pool.h"

#include <hidl/HidlTransportSupport.h>
#include <host/rpc_hooks.h>
#include <host/rpc_host.h>

#include <atomic>

namespace android {
namespace host {

namespace {
std::atomic<RpcHooks*> g_hooks{nullptr};
}  // namespace

void setRpcHooks(RpcHooks* hooks) { g_hooks.store(hooks); }

namespace rpc {

RpcHooks* currentHooks() { return g_hooks.load(); }

hardware::Status transportError(const std::string& message) {
  return hardware::Status::fromExceptionCode(hardware::Status::EX_TRANSACTION_FAILED, message);
}

}  // namespace rpc

void shutdownRpcHostForTest() { rpc::Host::get().shutdownHost(); }

}  // namespace host

namespace hardware {

void configureRpcThreadpool(size_t maxThreads, bool callerWillJoin) {
  host::RpcHooks* hooks = host::rpc::currentHooks();
  if (hooks && hooks->configureThreadpool) {
    hooks->configureThreadpool(maxThreads, callerWillJoin);
    return;
  }
  host::rpc::Host::get().configure(maxThreads, callerWillJoin);
}

void joinRpcThreadpool() {
  host::RpcHooks* hooks = host::rpc::currentHooks();
  if (hooks && hooks->joinThreadpool) {
    hooks->joinThreadpool();
    return;
  }
  host::rpc::Host::get().join();
}

}  // namespace hardware
}  // namespace android

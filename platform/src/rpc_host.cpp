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
std::atomic<int> g_callbackAnswerMs{rpc::kCallbackAnswerMs};
std::atomic<uint64_t> g_proxySerial{0};
}  // namespace

void setRpcHooks(RpcHooks* hooks) { g_hooks.store(hooks); }

namespace rpc {

RpcHooks* currentHooks() { return g_hooks.load(); }

int callbackAnswerLimitMs() { return g_callbackAnswerMs.load(std::memory_order_relaxed); }

uint64_t nextProxySerial() { return g_proxySerial.fetch_add(1, std::memory_order_relaxed) + 1; }

hardware::Status transportError(const std::string& message) {
  return hardware::Status::fromExceptionCode(hardware::Status::EX_TRANSACTION_FAILED, message);
}

}  // namespace rpc

void shutdownRpcHostForTest() { rpc::Host::get().shutdownHost(); }

void setCallbackAnswerLimitForTest(int ms) {
  g_callbackAnswerMs.store(ms > 0 ? ms : rpc::kCallbackAnswerMs, std::memory_order_relaxed);
}

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

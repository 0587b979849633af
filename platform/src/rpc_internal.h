#pragma once
// Between the generic transport (rpc_host.cpp and the rpc_* units beside it:
// sockets, frames, the pool) and the interface marshalling
// (secure_element_rpc.cpp: stubs and proxies).
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <android/hidl/base/1.0/IBase.h>
#include <hidl/HidlSupport.h>
#include <hidl/Status.h>
#include <host/rpc_wire.h>
#include <utils/Errors.h>

namespace android {
namespace host {
struct RpcHooks;
namespace rpc {

constexpr const char* kLogTag = "hidl_host";

class RemotePeer;

enum class StubResult {
  Replied,  // `out` holds the reply
  NoReply,  // the operation returned without calling its result callback
  Failed,   // the operation itself reported a transport-level failure
  BadCall,  // unknown method or malformed arguments: a protocol violation
};

// Runs one incoming call on a local object.
using StubFn = StubResult (*)(const sp<hidl::base::V1_0::IBase>& target, uint32_t method,
                              BodyReader& in, BodyWriter& out,
                              const std::shared_ptr<RemotePeer>& peer, std::string* error);

using ProxyFactory =
    std::function<sp<hidl::base::V1_0::IBase>(const std::shared_ptr<RemotePeer>&, uint32_t)>;

// One connection, as the interface code sees it.
class RemotePeer {
 public:
  virtual ~RemotePeer() = default;
  // Calls `method` on the peer's object `object` and waits for the reply.
  virtual hardware::Status call(uint32_t object, uint32_t method, const BodyWriter& args,
                                std::vector<uint8_t>* reply) = 0;
  // Links are kept by the proxy's serial (ProxyBase::serial), never by its
  // address: a freed proxy's address may be given to the next one.
  virtual bool linkToDeath(const sp<hardware::hidl_death_recipient>& recipient, uint64_t cookie,
                           const wp<hidl::base::V1_0::IBase>& who, uint64_t whoSerial) = 0;
  virtual bool unlinkToDeath(const sp<hardware::hidl_death_recipient>& recipient,
                             uint64_t whoSerial) = 0;
  // Lets the peer call `object`; its id (never 0) in *id. False when this side
  // cannot export objects.
  virtual bool exportObject(const sp<hidl::base::V1_0::IBase>& object, StubFn stub,
                            uint32_t* id) = 0;
  // The proxy for the peer's object `id`, one per id while it lives.
  virtual sp<hidl::base::V1_0::IBase> importObject(uint32_t id, const ProxyFactory& make) = 0;
  virtual int pollIncoming(int timeoutMs) = 0;
  virtual void setCallTimeout(int timeoutMs) = 0;
};

// A number no other proxy of this process has had or will have.
uint64_t nextProxySerial();

// What every proxy carries; lets host helpers find a proxy's connection.
class ProxyBase {
 public:
  ProxyBase(std::shared_ptr<RemotePeer> peer, uint32_t object)
      : mPeer(std::move(peer)), mObject(object), mSerial(nextProxySerial()) {}
  virtual ~ProxyBase() = default;
  const std::shared_ptr<RemotePeer>& peer() const { return mPeer; }
  uint32_t object() const { return mObject; }
  // Names this proxy in link tables for as long as the process runs.
  uint64_t serial() const { return mSerial; }

 protected:
  std::shared_ptr<RemotePeer> mPeer;
  uint32_t mObject;
  const uint64_t mSerial;
};

// The hooks installed by setRpcHooks(), or null.
RpcHooks* currentHooks();

hardware::Status transportError(const std::string& message);

// Server side: listens for `name`; calls on the instance go to `stub`.
status_t registerService(const std::string& descriptor, const std::string& name,
                         const sp<hidl::base::V1_0::IBase>& service, StubFn stub);
// Client side: a connection to the instance `name`, or null (reason in *error).
std::shared_ptr<RemotePeer> connectService(const std::string& name, std::string* error);

// As registerService, listening in the socket folder `dir` instead of the
// HIDL one; served by the same I/O loop and pool.
status_t registerServiceIn(const std::string& dir, const std::string& name,
                           const sp<hidl::base::V1_0::IBase>& service, StubFn stub);
// Client side: a connection to the socket at `path`, or null (reason in *error).
std::shared_ptr<RemotePeer> connectPath(const std::string& path, std::string* error);

}  // namespace rpc
}  // namespace host
}  // namespace android

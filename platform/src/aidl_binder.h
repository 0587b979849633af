#pragma once
// Between the NDK stand-in (binder_ndk.cpp: AIBinder, status, service
// manager) and the AIDL interface marshalling (secure_element_aidl_rpc.cpp).
// An AIBinder is an object of the RPC host, so the host serves AIDL objects
// and hands out proxies to them exactly as it does for HIDL ones.
#include <android/binder_auto_utils.h>
#include <android/binder_interface_utils.h>

#include <memory>
#include <string>
#include <vector>

#include "rpc_internal.h"

struct AIBinder : public ::android::hidl::base::V1_0::IBase {
  explicit AIBinder(const char* descriptor) : mDescriptor(descriptor) {}
  // The interface of a local binder; null for a remote one, whose interface
  // only its owner knows.
  const char* interfaceDescriptor() const { return mDescriptor; }

 private:
  const char* const mDescriptor;
};

namespace android {
namespace host {
namespace aidl_rpc {

using rpc::BodyReader;
using rpc::BodyWriter;
using rpc::RemotePeer;
using rpc::StubResult;

// Runs one incoming call on a local object. The reply starts with the call's
// status (writeStatus), followed by the results when it is OK.
using TransactFn = StubResult (*)(ndk::ICInterface* target, uint32_t code, BodyReader& in,
                                  BodyWriter& out, const std::shared_ptr<RemotePeer>& peer,
                                  std::string* error);

// A binder for a local object; it keeps the object alive.
ndk::SpAIBinder newLocalBinder(std::shared_ptr<ndk::ICInterface> object, const char* descriptor,
                               TransactFn transact);
// The object behind a local binder of `descriptor`; null for anything else.
std::shared_ptr<ndk::ICInterface> localObject(const ndk::SpAIBinder& binder,
                                              const char* descriptor);

// Calls `code` on a remote binder and waits. The returned status is the
// callee's, or a transport failure; on OK *results holds what follows it.
ndk::ScopedAStatus callRemote(AIBinder* binder, uint32_t code, const BodyWriter& args,
                              std::vector<uint8_t>* results);
void writeStatus(BodyWriter& out, const ndk::ScopedAStatus& status);

// A binder argument on the wire: 0 for null, else an object id of the
// connection. Only local binders can be passed to a peer.
bool writeBinder(AIBinder* via, const ndk::SpAIBinder& binder, BodyWriter& out,
                 std::string* error);
ndk::SpAIBinder readBinder(uint32_t id, const std::shared_ptr<RemotePeer>& peer);

}  // namespace aidl_rpc
}  // namespace host
}  // namespace android

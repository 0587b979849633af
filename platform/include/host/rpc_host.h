#pragma once
// Host-only extras of the RPC host, for clients and tests. The daemon's code
// never needs these; it uses the platform calls only.
#include <string>
#include <vector>

#include <android/hidl/base/1.0/IBase.h>

namespace android {
namespace host {

// Folder that holds one listening socket per registered instance.
std::string serviceSocketDir();
std::string serviceSocketPath(const std::string& name);
// Instances whose socket accepts a connection now, sorted by name.
std::vector<std::string> listServices();

// Client side: serves calls that the peer of `proxy`'s connection makes on
// objects this client passed to it (callbacks), for up to timeoutMs (< 0: no
// limit). Returns once at least one call was served and no other is waiting,
// with the number served; 0 on time-out; -1 when the connection is gone or
// `proxy` is not a proxy.
int pollIncomingCalls(const sp<hidl::base::V1_0::IBase>& proxy, int timeoutMs);

// Client side: the longest time a call on `proxy`'s connection waits for its
// reply (< 0: no limit, the default). A call that runs out gets a transport
// error and the connection is closed, since a late reply could no longer be
// matched. False when `proxy` is not a proxy.
bool setCallTimeout(const sp<hidl::base::V1_0::IBase>& proxy, int timeoutMs);

// Tests: stops the host of this process: closes every socket and connection,
// stops the pool and makes joinRpcThreadpool() return. No death
// notifications are sent for the connections closed here. The host can be
// configured and used again afterwards.
void shutdownRpcHostForTest();

// Tests: how long the host waits for a client to answer a call on its
// callback object before it drops the client as dead (the product's 5 s
// otherwise); 0 or less restores 5 s.
void setCallbackAnswerLimitForTest(int ms);

}  // namespace host
}  // namespace android

#pragma once
// Host-only extras of the AIDL stand-in, for clients and tests. The daemon's
// code never needs these; it uses the NDK calls only.
#include <cstddef>
#include <string>
#include <vector>

#include <android/binder_ibinder.h>

namespace android {
namespace host {

// Folder under which AIDL instances listen: the socket of
// "package.IName/instance" is <dir>/package.IName/instance.
std::string aidlSocketDir();
std::string aidlSocketPath(const std::string& instance);
// Full names of the AIDL instances whose socket accepts a connection now, sorted.
std::vector<std::string> listAidlServices();

// As the HIDL helpers of rpc_host.h, for the connection of a remote binder
// (one that AServiceManager_checkService gave): serve the calls the service
// makes on this client's callbacks, and bound the wait for replies.
int pollIncomingCalls(AIBinder* binder, int timeoutMs);
bool setCallTimeout(AIBinder* binder, int timeoutMs);

// Tests: the links of `recipient` alive anywhere in the host (its own table,
// connections' tables, a notice being run).
size_t liveDeathLinksForTest(const AIBinder_DeathRecipient* recipient);

}  // namespace host
}  // namespace android

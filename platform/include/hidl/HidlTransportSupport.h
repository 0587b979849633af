#pragma once
#include <cstddef>

#include <hidl/HidlSupport.h>

namespace android {
namespace hardware {

// At most maxThreads incoming calls run at once; with callerWillJoin the
// thread that later calls joinRpcThreadpool() is one of them.
void configureRpcThreadpool(size_t maxThreads, bool callerWillJoin);
// Serves incoming calls on the calling thread; not expected to return.
void joinRpcThreadpool();

}  // namespace hardware
}  // namespace android

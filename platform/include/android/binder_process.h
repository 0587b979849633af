#pragma once
// Host stand-in for the NDK's binder thread pool. On a host the AIDL and HIDL
// instances of a process are served by one pool and one I/O thread (see
// configureRpcThreadpool), so these add no threads of their own.
#include <cstdint>

extern "C" {
bool ABinderProcess_setThreadPoolMaxThreadCount(uint32_t numThreads);
void ABinderProcess_startThreadPool();
// Serves incoming calls on the calling thread; not expected to return.
void ABinderProcess_joinThreadPool();
}

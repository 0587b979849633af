#pragma once
// Host stand-in for the NDK's service manager calls.
#include <android/binder_ibinder.h>
#include <android/binder_status.h>

extern "C" {
// Serves `binder` under the full instance name ("package.IName/instance");
// EX_NONE when registered.
binder_exception_t AServiceManager_addService(AIBinder* binder, const char* instance);
// Client side: a strong reference to the instance, or null when it is not
// registered now.
AIBinder* AServiceManager_checkService(const char* instance);
}

#pragma once
// Host stand-in for the NDK's binder objects: reference counting, weak
// references and death notification. An AIBinder is either local (an object
// of this process) or remote (a proxy for an object of a peer process).
#include <cstdint>

#include <sys/types.h>

#include <android/binder_status.h>

struct AIBinder;
typedef struct AIBinder AIBinder;
struct AIBinder_Weak;
typedef struct AIBinder_Weak AIBinder_Weak;
struct AIBinder_DeathRecipient;
typedef struct AIBinder_DeathRecipient AIBinder_DeathRecipient;

typedef void (*AIBinder_DeathRecipient_onBinderDied)(void* cookie);

extern "C" {
void AIBinder_incStrong(AIBinder* binder);
void AIBinder_decStrong(AIBinder* binder);
bool AIBinder_isRemote(const AIBinder* binder);

AIBinder_Weak* AIBinder_Weak_new(AIBinder* binder);
void AIBinder_Weak_delete(AIBinder_Weak* weakBinder);
// A strong reference while the object lives, else null.
AIBinder* AIBinder_Weak_promote(AIBinder_Weak* weakBinder);

AIBinder_DeathRecipient* AIBinder_DeathRecipient_new(AIBinder_DeathRecipient_onBinderDied onBinderDied);
// After this no notice of the recipient runs any more.
void AIBinder_DeathRecipient_delete(AIBinder_DeathRecipient* recipient);
// Remote binders only: `onBinderDied(cookie)` runs once when the peer goes.
// STATUS_INVALID_OPERATION for a local binder, STATUS_DEAD_OBJECT when the
// peer is already gone.
binder_status_t AIBinder_linkToDeath(AIBinder* binder, AIBinder_DeathRecipient* recipient,
                                     void* cookie);
binder_status_t AIBinder_unlinkToDeath(AIBinder* binder, AIBinder_DeathRecipient* recipient,
                                       void* cookie);

// The client process of the incoming call this thread serves (or whose
// death notice it runs); outside of one, this process itself.
pid_t AIBinder_getCallingPid();
uid_t AIBinder_getCallingUid();
}

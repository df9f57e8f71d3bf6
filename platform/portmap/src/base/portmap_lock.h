// Test seams of the system-wide port-map lock (KLibZarkPortMapLock). Not
// for production callers.
#ifndef ZARK_PORTMAP_BASE_PORTMAP_LOCK_H
#define ZARK_PORTMAP_BASE_PORTMAP_LOCK_H

#include <chrono>
#include <functional>

// How long KLibZarkPortMapLock waits for a lock held elsewhere before it
// gives up (default 30 s). Applies to lock attempts that start afterwards.
void ZarkPortMapSetLockTimeoutForTesting(std::chrono::milliseconds timeout);

// Called by a thread waiting in KLibZarkPortMapLock each time it finds the
// lock held elsewhere, before it sleeps; an empty function removes it. Lets
// a test know for sure that a lock attempt is waiting.
void ZarkPortMapSetLockWaitHookForTesting(std::function<void()> hook);

#endif

#pragma once
// A manual-reset event in user space: one byte that waiters sleep on with
// WaitOnAddress. Used where events are set and waited for very often; a
// kernel event costs a round trip to the kernel (under Wine, to the
// wineserver) for every create, set and close, and a condition variable
// would add a pointer to every item.
#include "SyncObject.h"

#include <windows.h>

//
// The flag is guarded by its owner's lock, of which it keeps no pointer: an
// item has one lock however many waits it serves, and is as small as it can
// be. Set and Reset are called with that lock held, Wait without it (it
// checks under the lock and lets go of it while it sleeps).
class CManualResetEvent {
public:
    CManualResetEvent() = default;
    CManualResetEvent(const CManualResetEvent &) = delete;
    CManualResetEvent &operator=(const CManualResetEvent &) = delete;

    // Inline: an item's event is set at every network update, and nearly
    // always is already.
    void Set()
    {
        if (!m_signalled)
            Signal();
    }
    void Reset() { m_signalled = 0; }
    // True when the event is (or becomes) signalled within timeoutMs.
    bool Wait(CSlimLock &lock, DWORD timeoutMs);

private:
    void Signal();

    volatile char m_signalled = 0;
};

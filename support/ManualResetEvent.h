#pragma once
// A manual-reset event in user space: a flag with a condition variable. Used
// where events are set and waited for very often; a kernel event costs a
// round trip to the kernel (under Wine, to the wineserver) for every
// create, set and close.
#include "SyncObject.h"

#include <windows.h>

//
// It sleeps on its owner's lock rather than one of its own, and keeps no
// pointer to it: an item has one lock however many waits it serves, and is
// as small as it can be. Set and Reset are called with that lock held, Wait
// without it.
class CManualResetEvent {
public:
    CManualResetEvent() { InitializeConditionVariable(&m_changed); }
    CManualResetEvent(const CManualResetEvent &) = delete;
    CManualResetEvent &operator=(const CManualResetEvent &) = delete;

    void Set();
    void Reset() { m_signalled = false; }
    // True when the event is (or becomes) signalled within timeoutMs.
    bool Wait(CSlimLock &lock, DWORD timeoutMs);

private:
    CONDITION_VARIABLE m_changed;
    bool m_signalled = false;
};

#pragma once
// A manual-reset event in user space: a flag with a condition variable. Used
// where events are set and waited for very often; a kernel event costs a
// round trip to the kernel (under Wine, to the wineserver) for every
// create, set and close.
#include "SyncObject.h"

#include <atomic>
#include <windows.h>

//
// It sleeps on its owner's lock rather than one of its own: an item has one
// lock however many waits it serves. Wait must be called without that lock
// held; Set and Reset may be called with it held or not.
class CManualResetEvent {
public:
    explicit CManualResetEvent(CCriticalSection &lock) : m_lock(lock) { InitializeConditionVariable(&m_changed); }
    CManualResetEvent(const CManualResetEvent &) = delete;
    CManualResetEvent &operator=(const CManualResetEvent &) = delete;

    void Set();
    void Reset();
    // True when the event is (or becomes) signalled within timeoutMs.
    bool Wait(DWORD timeoutMs);

private:
    // Read without the lock by Set, which the network calls at every value:
    // setting a set event changes nothing and needs no lock.
    std::atomic<bool> m_signalled{false};
    CCriticalSection &m_lock;
    CONDITION_VARIABLE m_changed;
};

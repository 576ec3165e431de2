#include "ManualResetEvent.h"

void CManualResetEvent::Signal()
{
    m_signalled = 1;
    WakeByAddressAll(const_cast<char *>(&m_signalled));
}

bool CManualResetEvent::Wait(CSlimLock &lock, DWORD timeoutMs)
{
    DWORD start = GetTickCount();
    CSlimLockHolder held(&lock);
    while (!m_signalled) {
        DWORD elapsed = GetTickCount() - start;
        if (elapsed >= timeoutMs)
            return false;
        // A Set between the unlock and the wait is not lost: the wait
        // returns at once when the byte is no longer 0. Spurious wake-ups
        // and time-outs both come back to the check under the lock.
        char unsignalled = 0;
        held.Unlock();
        WaitOnAddress(&m_signalled, &unsignalled, sizeof unsignalled, timeoutMs - elapsed);
        held.Lock();
    }
    return true;
}

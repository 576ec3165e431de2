#include "ManualResetEvent.h"

void CManualResetEvent::Set()
{
    if (!m_signalled) {
        m_signalled = true;
        WakeAllConditionVariable(&m_changed);
    }
}

bool CManualResetEvent::Wait(CSlimLock &lock, DWORD timeoutMs)
{
    DWORD start = GetTickCount();
    CSlimLockHolder held(&lock);
    while (!m_signalled) {
        DWORD elapsed = GetTickCount() - start;
        if (elapsed >= timeoutMs)
            return false;
        // Spurious wake-ups and time-outs both come back to the check.
        SleepConditionVariableSRW(&m_changed, lock.Native(), timeoutMs - elapsed, 0);
    }
    return true;
}

#include "ManualResetEvent.h"

void CManualResetEvent::Set()
{
    if (m_signalled.load(std::memory_order_acquire))
        return; // a Reset racing with this Set may win: as if it came after
    CSingleLock lock(&m_lock);
    if (!m_signalled) {
        m_signalled = true;
        WakeAllConditionVariable(&m_changed);
    }
}

void CManualResetEvent::Reset()
{
    CSingleLock lock(&m_lock);
    m_signalled = false;
}

bool CManualResetEvent::Wait(DWORD timeoutMs)
{
    DWORD start = GetTickCount();
    CSingleLock lock(&m_lock);
    while (!m_signalled) {
        DWORD elapsed = GetTickCount() - start;
        if (elapsed >= timeoutMs)
            return false;
        // Spurious wake-ups and time-outs both come back to the check.
        SleepConditionVariableCS(&m_changed, m_lock.Native(), timeoutMs - elapsed);
    }
    return true;
}

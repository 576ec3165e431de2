#include "ServerLifetime.h"

#include "Trace.h"

#include <algorithm>

CServerLifetime::CServerLifetime(CClassRegistration &registration, const Timing &timing, bool idleFromStart)
    : m_registration(registration), m_timing(timing), m_wake(CreateEventW(nullptr, FALSE, FALSE, nullptr)),
      m_exitWhenIdle(idleFromStart), m_since(timing.now())
{
    if (!m_wake)
        INTERNAL_ASSERT_FAILED("CreateEvent for the server lifetime");
}

void CServerLifetime::Wake()
{
    if (m_wake)
        SetEvent(m_wake.Get());
}

void CServerLifetime::Lock()
{
    CSingleLock lock(&m_lock);
    ++m_count;
    if (m_phase == Phase::Draining)
        Wake(); // the main thread restores the registration
}

bool CServerLifetime::TryLock()
{
    CSingleLock lock(&m_lock);
    if (m_phase == Phase::Stopped)
        return false;
    ++m_count;
    if (m_phase == Phase::Draining)
        Restore(); // at once: the same client may ask the registry next
    return true;
}

void CServerLifetime::Unlock()
{
    CSingleLock lock(&m_lock);
    if (m_count <= 0) {
        INTERNAL_ASSERT_FAILED("server lock count below 0");
        return;
    }
    if (--m_count == 0) {
        m_exitWhenIdle = true;
        m_since = m_timing.now();
        Wake();
    }
}

LONG CServerLifetime::Count()
{
    CSingleLock lock(&m_lock);
    return m_count;
}

void CServerLifetime::IncomingCall()
{
    // Every call of every client passes here: a time is stored and a word
    // read, nothing more, unless the class object has just been revoked.
    // The call may be the platform's own request for the class object, on
    // its way to a lookup that a revocation now would make fail: the stored
    // time keeps the revocation away (Advance reads it after it says it is
    // draining, this reads the phase after storing the time; with both in
    // sequential order one of the two sees the other).
    m_lastCall.store(m_timing.now());
    if (m_phase.load() != Phase::Draining)
        return;
    CSingleLock lock(&m_lock);
    if (m_phase == Phase::Draining)
        Restore();
}

void CServerLifetime::Restore()
{
    // A client is on its way: it finds the class object again before its
    // call is served, and the grace period starts over.
    HRESULT hr = m_registration.Register();
    Trace("lifetime %lu at %llu: class object registered again (0x%08lX)\n", GetCurrentProcessId(), m_timing.now(),
          static_cast<unsigned long>(hr));
    if (FAILED(hr))
        INTERNAL_ASSERT_FAILED("registering the class object again");
    m_phase = Phase::Serving;
    m_since = m_timing.now();
    Wake();
}

CServerLifetime::Phase CServerLifetime::Advance(DWORD &waitMs)
{
    CSingleLock lock(&m_lock);
    waitMs = INFINITE;
    ULONGLONG now = m_timing.now();
    switch (m_phase) {
    case Phase::Serving:
        if (m_count > 0 || !m_exitWhenIdle)
            break;
        // Draining before the grace period is even looked at: the platform
        // forgets the class object here before it stops handing it out, and
        // a call that comes in meanwhile must either be seen here (its time)
        // or see the draining phase and wait for this lock to restore it.
        // Idle counts from the last release or the last call, whichever
        // came later.
        m_phase = Phase::Draining;
        if (ULONGLONG idleSince = std::max(m_since, m_lastCall.load()); idleSince + m_timing.graceMs > now) {
            m_phase = Phase::Serving;
            waitMs = static_cast<DWORD>(idleSince + m_timing.graceMs - now);
            break;
        }
        m_registration.Revoke();
        m_since = m_timing.now();
        Trace("lifetime %lu at %llu: class object revoked\n", GetCurrentProcessId(), m_since);
        waitMs = m_timing.drainMs;
        break;
    case Phase::Draining:
        if (m_count > 0) {
            Restore();
            break;
        }
        if (now - m_since < m_timing.drainMs) {
            waitMs = static_cast<DWORD>(m_timing.drainMs - (now - m_since));
            break;
        }
        m_phase = Phase::Stopped;
        Trace("lifetime %lu at %llu: stopped\n", GetCurrentProcessId(), now);
        break;
    case Phase::Stopped:
        break;
    }
    return m_phase;
}

CServerLifetime::Phase CServerLifetime::CurrentPhase()
{
    CSingleLock lock(&m_lock);
    return m_phase;
}

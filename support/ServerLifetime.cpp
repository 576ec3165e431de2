#include "ServerLifetime.h"

#include "Trace.h"

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
        Wake(); // the main thread switches back
}

bool CServerLifetime::TryLock()
{
    CSingleLock lock(&m_lock);
    if (m_phase == Phase::Stopped)
        return false;
    ++m_count;
    if (m_phase == Phase::Draining)
        Restore(); // at once: the same client's next activation asks the registry
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

bool CServerLifetime::ClassObjectQueried(bool byProbe)
{
    CSingleLock lock(&m_lock);
    if (m_switching)
        return !byProbe; // the platform's own look at the object while it registers it
    ULONGLONG now = m_timing.now();
    if (byProbe) {
        // Only a probe that asked the registry after the drain period began
        // can have taken the answer given out once; one that got the shared
        // registration before the switch took nothing.
        if (m_phase == Phase::Draining && now - m_since >= m_timing.drainMs && !m_taken) {
            m_taken = true;
            Trace("lifetime %lu at %llu: a probe took the last registration\n", GetCurrentProcessId(), now);
            Wake();
        }
        return false;
    }
    // A client is here: it will create an object, and the grace period
    // starts over whatever it does.
    if (m_phase == Phase::Draining)
        Restore();
    else if (m_phase == Phase::Serving)
        m_since = now;
    return true;
}

void CServerLifetime::ProbeFinished()
{
    CSingleLock lock(&m_lock);
    m_probing = false;
    m_nextProbe = m_timing.now() + m_timing.probeRetryMs;
    Wake();
}

void CServerLifetime::Restore()
{
    m_switching = true;
    HRESULT hr = m_registration.Switch(CClassRegistration::Use::Shared);
    m_switching = false;
    Trace("lifetime %lu at %llu: serving again (0x%08lX)\n", GetCurrentProcessId(), m_timing.now(),
          static_cast<unsigned long>(hr));
    if (FAILED(hr))
        INTERNAL_ASSERT_FAILED("registering the class object for every client again");
    m_phase = Phase::Serving;
    m_since = m_timing.now();
    Wake();
}

void CServerLifetime::Drain(ULONGLONG now)
{
    m_switching = true;
    HRESULT hr = m_registration.Switch(CClassRegistration::Use::Once);
    m_switching = false;
    Trace("lifetime %lu at %llu: draining (0x%08lX)\n", GetCurrentProcessId(), now, static_cast<unsigned long>(hr));
    if (FAILED(hr))
        INTERNAL_ASSERT_FAILED("registering the class object for one client");
    m_phase = Phase::Draining;
    m_since = now;
    m_probes = 0;
    m_taken = false;
    m_probing = false; // one of an earlier drain that never returned counts no more
    m_nextProbe = now + m_timing.drainMs;
}

void CServerLifetime::Stop(ULONGLONG now, const char *why)
{
    m_phase = Phase::Stopped;
    m_registration.Revoke();
    Trace("lifetime %lu at %llu: stopped (%s)\n", GetCurrentProcessId(), now, why);
}

DWORD CServerLifetime::StepDraining(ULONGLONG now)
{
    if (m_count > 0) {
        Restore();
        return INFINITE;
    }
    if (m_taken) {
        Stop(now, "a probe took the last registration");
        return INFINITE;
    }
    if (m_probing) {
        if (now - m_probeStart < m_timing.probeLimitMs)
            return static_cast<DWORD>(m_timing.probeLimitMs - (now - m_probeStart));
        // The registry had nothing and the probe waits for a server it had
        // started: a client took the last registration and has not come.
        Stop(now, "the probe did not return");
        return INFINITE;
    }
    if (now < m_nextProbe)
        return static_cast<DWORD>(m_nextProbe - now);
    if (m_probes >= m_timing.probes) {
        Stop(now, "every probe found another server first");
        return INFINITE;
    }
    ++m_probes;
    m_probing = true;
    m_probeStart = now;
    m_registration.Probe();
    return m_timing.probeLimitMs;
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
        if (m_since + m_timing.graceMs > now) {
            waitMs = static_cast<DWORD>(m_since + m_timing.graceMs - now);
            break;
        }
        Drain(now);
        waitMs = m_timing.drainMs;
        break;
    case Phase::Draining:
        waitMs = StepDraining(now);
        break;
    case Phase::Stopped:
        break;
    }
    return m_phase;
}

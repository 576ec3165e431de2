#pragma once
// When a local server process may end, and what it does with its class
// object on the way.
//
// The process does not end the moment its lock count falls to 0: clients
// that connect at nearly the same time would lose it. The system's registry
// of running class objects hands this process's class object out; a client
// that got it then calls into the process to look the class up there, and
// that lookup fails if the class object has been revoked in between. Where
// CoSuspendClassObjects does nothing and nobody retries a failed lookup
// (Wine), a revocation is safe only when nobody holds a registry answer that
// still leads here. So the process takes itself out of the registry through
// a registration that the registry gives out once:
//
//   serving   registered for any number of clients. When the count is 0 and
//             has stayed 0 for the grace period, the registration is switched
//             to one that the registry hands out once. The switch never leaves
//             the process without a class object: a client that got the old
//             registration finds the new one.
//   draining  registered for one more client. A client that reaches the
//             class object, a creation or a LockServer(TRUE) switches back
//             to serving. Once the drain period has passed, the process asks
//             the registry for its class as a client would (a probe, marked
//             as one): a probe that reaches a draining process has taken the
//             registry's last answer that leads to it, so no client can still
//             be on its way and the process stops. A probe that finds another
//             server first is repeated a few times; then the process stops
//             anyway: its registration sits behind one that clients reach
//             first.
//   stopped   the decision is final: the class object is revoked, creations
//             and LockServer(TRUE) get CO_E_SERVER_STOPPING, and the process
//             leaves (bounded by CExitWatchdog whatever the platform's
//             uninitialisation does).
//
// A process that COM started counts as idle from its start; one started by
// hand stays until its count has once risen above 0 and fallen back to 0.
#include "Handle.h"
#include "SyncObject.h"

#include <windows.h>

// What the lifetime does to the class object.
class CClassRegistration {
public:
    enum class Use {
        Shared, // handed out to any number of clients
        Once    // handed out to one client, then the registry forgets it
    };
    // The first registration.
    virtual HRESULT Register(Use use) = 0;
    // Replaces the registration; a lookup in this process never falls
    // between the two.
    virtual HRESULT Switch(Use use) = 0;
    virtual void Revoke() = 0;
    // Asks the registry for the class as a client would, marked as a probe,
    // on a thread of its own; CServerLifetime::ProbeFinished follows.
    virtual void Probe() = 0;

protected:
    ~CClassRegistration() = default;
};

class CServerLifetime {
public:
    struct Timing {
        DWORD graceMs = 5000;      // idle before the registration is given out once more only
        DWORD drainMs = 1500;      // draining before the first probe
        DWORD probeRetryMs = 300;  // between probes that found another server
        DWORD probeLimitMs = 5000; // a probe that takes longer counts as failed
        int probes = 4;            // probes before the process stops anyway
        ULONGLONG (*now)() = &GetTickCount64;
    };
    enum class Phase { Serving, Draining, Stopped };

    // The caller registers the class object (Use::Shared) once the lifetime
    // is in place.
    // idleFromStart: the process counts as idle from now (COM started it).
    CServerLifetime(CClassRegistration &registration, const Timing &timing, bool idleFromStart);
    CServerLifetime(const CServerLifetime &) = delete;
    CServerLifetime &operator=(const CServerLifetime &) = delete;

    // Every live object holds one count.
    void Lock();
    void Unlock();
    LONG Count();
    // A creation or LockServer(TRUE): one count more, or false once the
    // process has decided to exit (the caller answers CO_E_SERVER_STOPPING).
    bool TryLock();
    // A lookup reached the registered class object. Returns whether to hand
    // it out: a probe never gets it.
    bool ClassObjectQueried(bool byProbe);
    // The probe's thread is done.
    void ProbeFinished();

    // The main thread's step: switches the registration when due and says
    // how long to wait (ms, INFINITE) before the next step, or returns
    // Stopped once the class object is revoked and the process must leave.
    Phase Advance(DWORD &waitMs);
    // Signalled whenever the next step may come earlier than it said.
    HANDLE WakeEvent() const { return m_wake.Get(); }

private:
    void Restore();
    void Drain(ULONGLONG now);
    void Stop(ULONGLONG now, const char *why);
    DWORD StepDraining(ULONGLONG now);
    void Wake();

    CClassRegistration &m_registration;
    const Timing m_timing;
    UniqueHandle m_wake;
    CCriticalSection m_lock{LockOrder::Leaf}; // the registration is called under it
    LONG m_count = 0;
    Phase m_phase = Phase::Serving;
    bool m_exitWhenIdle;
    bool m_switching = false; // the platform may look the class object up while it is switched
    ULONGLONG m_since;        // idle since (serving) or draining since
    // Draining: the probes so far, one in flight, and whether a probe took
    // the registry's last answer.
    int m_probes = 0;
    bool m_probing = false;
    bool m_taken = false;
    ULONGLONG m_probeStart = 0; // of the one in flight
    ULONGLONG m_nextProbe = 0;
};

#pragma once
// When a local server process may end, and what it does with its class
// object on the way.
//
// The process does not end the moment its lock count falls to 0: clients
// that connect at nearly the same time would lose it. COM hands out the
// registered class object of a running process to every client that asks;
// one client can get it, work and let go while another is still on its way
// to it, and a process that left at once would leave that client with no
// class object. Where CoSuspendClassObjects does nothing (Wine), nothing but
// the revocation keeps new clients away. So the protocol is:
//
//   serving   the class object is registered. When the count is 0 and has
//             stayed 0, with no call coming in, for the grace period, the
//             class object is revoked and the process is draining. A process
//             that COM started and that never receives an object counts as
//             idle from its start.
//   draining  new activations no longer find this process and start another.
//             A client that fetched the class object just before the
//             revocation may still arrive: any call that reaches the process
//             now (IncomingCall), a creation or LockServer(TRUE) restores the
//             registration and the process serves again. Quiet for the drain
//             period, it decides to exit.
//   stopped   the decision is final: creations and LockServer(TRUE) get
//             CO_E_SERVER_STOPPING, and the process leaves (bounded by
//             CExitWatchdog whatever the platform's uninitialisation does).
//
// A process started by hand (not by COM) stays until its count has once
// risen above 0 and fallen back to 0.
#include "Handle.h"
#include "SyncObject.h"

#include <windows.h>

#include <atomic>

// What the lifetime does to the class object.
class CClassRegistration {
public:
    virtual HRESULT Register() = 0;
    virtual void Revoke() = 0;

protected:
    ~CClassRegistration() = default;
};

class CServerLifetime {
public:
    struct Timing {
        DWORD graceMs = 5000; // idle before the class object is revoked
        DWORD drainMs = 1500; // revoked and quiet before the decision to exit
        ULONGLONG (*now)() = &GetTickCount64;
    };
    enum class Phase { Serving, Draining, Stopped };

    // The caller registers the class object once the lifetime is in place;
    // the lifetime revokes it and registers it again.
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
    // A call from a client reached the process.
    void IncomingCall();

    // The main thread's step: revokes or restores the registration when due
    // and says how long to wait (ms, INFINITE) before the next step, or
    // returns Stopped once the process must leave.
    Phase Advance(DWORD &waitMs);
    Phase CurrentPhase();
    // Signalled whenever the next step may come earlier than it said.
    HANDLE WakeEvent() const { return m_wake.Get(); }

private:
    void Restore();
    void Wake();

    CClassRegistration &m_registration;
    const Timing m_timing;
    UniqueHandle m_wake;
    CCriticalSection m_lock{LockOrder::Leaf}; // the registration is called under it
    LONG m_count = 0;
    std::atomic<Phase> m_phase{Phase::Serving}; // changed under the lock; read without it by IncomingCall
    std::atomic<ULONGLONG> m_lastCall{0};       // when a call last came in; written without the lock
    bool m_exitWhenIdle;
    ULONGLONG m_since; // idle since (serving) or revoked since (draining)
};

#pragma once
// Lockable objects and the scoped lock holder used for every lock in the server.
#include <windows.h>

class CSyncObject {
public:
    virtual ~CSyncObject() = default;
    virtual BOOL Lock(DWORD timeout = INFINITE) = 0;
    virtual BOOL Unlock() = 0;
};

// A recursive Win32 critical section; the timeout is ignored. It spins a
// while before it sleeps: the item locks are held for a few instructions, and
// the scan and the network's delivery thread walk the same items, so a lock
// that slept at once would make them wait for each other item after item.
class CCriticalSection : public CSyncObject {
public:
    CCriticalSection() { InitializeCriticalSectionEx(&m_cs, kSpinCount, CRITICAL_SECTION_NO_DEBUG_INFO); }
    static constexpr DWORD kSpinCount = 4000;
    ~CCriticalSection() override { DeleteCriticalSection(&m_cs); }
    CCriticalSection(const CCriticalSection &) = delete;
    CCriticalSection &operator=(const CCriticalSection &) = delete;

    BOOL Lock(DWORD = INFINITE) override
    {
        EnterCriticalSection(&m_cs);
        return TRUE;
    }
    BOOL Unlock() override
    {
        LeaveCriticalSection(&m_cs);
        return TRUE;
    }
    // For condition variables (entered exactly once by the sleeper).
    CRITICAL_SECTION *Native() { return &m_cs; }

private:
    CRITICAL_SECTION m_cs;
};

// A slim lock for objects that exist by the ten thousand (the items): an
// SRW lock, a pointer in size, with nothing to create or delete (a critical
// section costs a round trip to the wineserver when it is deleted, under
// Wine, and five times the memory). Not recursive, and not a CSyncObject: a
// table of virtual functions would add a pointer to every item. It spins a
// while before it sleeps, for the same reason as the critical section above.
class CSlimLock {
public:
    CSlimLock() = default;
    CSlimLock(const CSlimLock &) = delete;
    CSlimLock &operator=(const CSlimLock &) = delete;

    BOOL Lock(DWORD = INFINITE)
    {
        for (unsigned i = 0; i < kSpins; ++i) {
            if (TryAcquireSRWLockExclusive(&m_srw))
                return TRUE;
            YieldProcessor();
        }
        AcquireSRWLockExclusive(&m_srw);
        return TRUE;
    }
    BOOL Unlock()
    {
        ReleaseSRWLockExclusive(&m_srw);
        return TRUE;
    }
    // For condition variables (held exclusively by the sleeper).

private:
    static constexpr unsigned kSpins = 1000;
    SRWLOCK m_srw = SRWLOCK_INIT;
};

// Scoped holder: counts its own acquisitions and undoes them all when it goes
// out of scope, normally or by an exception. CSingleLock holds any
// CSyncObject; a slim lock has a holder of its own type.
template <class Lockable> class CScopedLock {
public:
    explicit CScopedLock(Lockable *object, bool lockNow = true) : m_object(object)
    {
        if (lockNow)
            Lock();
    }
    ~CScopedLock()
    {
        while (m_count > 0)
            Unlock();
    }
    CScopedLock(const CScopedLock &) = delete;
    CScopedLock &operator=(const CScopedLock &) = delete;

    BOOL Lock(DWORD timeout = INFINITE)
    {
        BOOL taken = m_object->Lock(timeout);
        if (taken)
            ++m_count;
        return taken;
    }
    BOOL Unlock()
    {
        if (m_count == 0)
            return FALSE;
        --m_count;
        return m_object->Unlock();
    }
    bool IsLocked() const { return m_count > 0; }

private:
    Lockable *m_object;
    unsigned m_count = 0;
};

using CSingleLock = CScopedLock<CSyncObject>;
using CSlimLockHolder = CScopedLock<CSlimLock>;

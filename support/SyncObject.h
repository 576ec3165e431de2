#pragma once
// Lockable objects and the scoped lock holder used for every lock in the server.
#include "LockOrder.h"

#include <windows.h>

#include <atomic>

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
    // level: its place in the lock order (LockOrder.h), checked in debug
    // builds when it is taken.
    explicit CCriticalSection(LockOrder::Level level = LockOrder::Unchecked) : m_level(level)
    {
        InitializeCriticalSectionEx(&m_cs, kSpinCount, CRITICAL_SECTION_NO_DEBUG_INFO);
    }
    static constexpr DWORD kSpinCount = 4000;
    ~CCriticalSection() override { DeleteCriticalSection(&m_cs); }
    CCriticalSection(const CCriticalSection &) = delete;
    CCriticalSection &operator=(const CCriticalSection &) = delete;

    BOOL Lock(DWORD = INFINITE) override
    {
#ifndef NDEBUG
        LockOrder::Acquire(this, m_level);
#endif
        EnterCriticalSection(&m_cs);
        return TRUE;
    }
    BOOL Unlock() override
    {
        LeaveCriticalSection(&m_cs);
#ifndef NDEBUG
        LockOrder::Release(this);
#endif
        return TRUE;
    }
    // For condition variables (entered exactly once by the sleeper).
    CRITICAL_SECTION *Native()
    {
        return &m_cs;
    }

private:
    CRITICAL_SECTION m_cs;
    LockOrder::Level m_level;
};

// A slim lock for objects that exist by the ten thousand (the items): one
// word, with nothing to create or delete (a critical section costs a round
// trip to the wineserver when it is deleted, under Wine, and five times the
// memory). Free, it is taken and given back with one atomic operation each;
// only a holder that finds it held sleeps on the word (WaitOnAddress), and
// only a release that knows of sleepers wakes one. An SRW lock would do, but
// under Wine its release calls into the keyed waiters' table every time, and
// a plant's items take a million updates a second under their locks. Not
// recursive, and not a CSyncObject: a table of virtual functions would add
// a pointer to every item. It spins a while before it sleeps, for the same
// reason as the critical section above.
class CSlimLock {
public:
    CSlimLock() = default;
    CSlimLock(const CSlimLock &) = delete;
    CSlimLock &operator=(const CSlimLock &) = delete;

    BOOL Lock(DWORD = INFINITE)
    {
        LONG free = kFree;
        if (m_state.compare_exchange_strong(free, kHeld, std::memory_order_acquire))
            return TRUE;
        for (unsigned i = 0; i < kSpins; ++i) {
            YieldProcessor();
            free = kFree;
            if (m_state.load(std::memory_order_relaxed) == kFree &&
                m_state.compare_exchange_weak(free, kHeld, std::memory_order_acquire))
                return TRUE;
        }
        // Held: announce a sleeper and sleep until a release sees it. Taken
        // this way the word stays "with sleepers", so the release wakes one
        // more than needed at worst, never one less.
        while (m_state.exchange(kSleepers, std::memory_order_acquire) != kFree) {
            LONG sleepers = kSleepers;
            WaitOnAddress(&m_state, &sleepers, sizeof sleepers, INFINITE);
        }
        return TRUE;
    }
    BOOL Unlock()
    {
        if (m_state.exchange(kFree, std::memory_order_release) == kSleepers)
            WakeByAddressSingle(&m_state);
        return TRUE;
    }

private:
    static constexpr unsigned kSpins = 1000;
    static constexpr LONG kFree = 0, kHeld = 1, kSleepers = 2;
    std::atomic<LONG> m_state{kFree};
    static_assert(sizeof(std::atomic<LONG>) == sizeof(LONG), "WaitOnAddress compares the word itself");
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

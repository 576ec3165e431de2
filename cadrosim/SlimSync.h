#pragma once
// A mutex and a condition variable on the system's slim reader/writer lock.
// The standard ones of the MinGW threading library go through kernel objects,
// and under Wine every wake is then a round trip through the Wine server:
// tens of microseconds for each subscription the engine is told about.
#include <windows.h>

#include <atomic>
#include <chrono>
#include <mutex>

namespace cadrosim {

class SlimMutex {
public:
    SlimMutex() = default;
    SlimMutex(const SlimMutex &) = delete;
    SlimMutex &operator=(const SlimMutex &) = delete;
    void lock() { AcquireSRWLockExclusive(&m_lock); }
    void unlock() { ReleaseSRWLockExclusive(&m_lock); }
    bool try_lock() { return TryAcquireSRWLockExclusive(&m_lock) != FALSE; }
    // Shared holders (std::shared_lock) exclude exclusive ones only.
    void lock_shared() { AcquireSRWLockShared(&m_lock); }
    void unlock_shared() { ReleaseSRWLockShared(&m_lock); }
    SRWLOCK *native() { return &m_lock; }

private:
    SRWLOCK m_lock = SRWLOCK_INIT;
};

class SlimCondition {
public:
    SlimCondition() = default;
    SlimCondition(const SlimCondition &) = delete;
    SlimCondition &operator=(const SlimCondition &) = delete;
    // A wake with nobody asleep is skipped: under Wine it is a system call.
    // Waiters count themselves under the mutex before they sleep, and a
    // notifier changes what they wait for under it too, so a waiter either
    // sees the change or is counted.
    void notify_one()
    {
        if (m_waiters.load() != 0)
            WakeConditionVariable(&m_condition);
    }
    void notify_all()
    {
        if (m_waiters.load() != 0)
            WakeAllConditionVariable(&m_condition);
    }
    void wait(std::unique_lock<SlimMutex> &l) { Sleep(l, INFINITE); }
    template <class Predicate> void wait(std::unique_lock<SlimMutex> &l, Predicate ready)
    {
        while (!ready())
            Sleep(l, INFINITE);
    }
    // Returns at the time or earlier (callers check their condition again).
    template <class Clock, class Duration>
    void wait_until(std::unique_lock<SlimMutex> &l, const std::chrono::time_point<Clock, Duration> &at)
    {
        auto left = std::chrono::ceil<std::chrono::milliseconds>(at - Clock::now()).count();
        if (left > 0)
            Sleep(l, left >= INFINITE ? INFINITE - 1 : static_cast<DWORD>(left));
    }

private:
    void Sleep(std::unique_lock<SlimMutex> &l, DWORD ms)
    {
        ++m_waiters;
        SleepConditionVariableSRW(&m_condition, l.mutex()->native(), ms, 0);
        --m_waiters;
    }
    CONDITION_VARIABLE m_condition = CONDITION_VARIABLE_INIT;
    std::atomic<unsigned> m_waiters{0};
};

} // namespace cadrosim

#include "GroupActivity.h"

#include "Trace.h"

#include <objbase.h>

#include <algorithm>
#include <utility>

bool LogicalCaller::operator==(const LogicalCaller &o) const
{
    // Without a logical thread (COM refused it), the physical one decides.
    if (IsEqualGUID(logicalThread, GUID_NULL) || IsEqualGUID(o.logicalThread, GUID_NULL))
        return thread == o.thread;
    return IsEqualGUID(logicalThread, o.logicalThread) != FALSE;
}

LogicalCaller LogicalCaller::Current()
{
    LogicalCaller c{GUID_NULL, GetCurrentThreadId()};
    if (FAILED(CoGetCurrentLogicalThreadId(&c.logicalThread)))
        c.logicalThread = GUID_NULL;
    return c;
}

namespace {
CCriticalSection g_callbacksLock(LockOrder::Leaf);
std::vector<LogicalCaller> g_callbacks;
} // namespace

void CallbacksInFlight::Enter(const LogicalCaller &caller)
{
    CSingleLock lock(&g_callbacksLock);
    g_callbacks.push_back(caller);
}

void CallbacksInFlight::Leave(const LogicalCaller &caller)
{
    CSingleLock lock(&g_callbacksLock);
    auto it = std::find(g_callbacks.begin(), g_callbacks.end(), caller);
    if (it != g_callbacks.end())
        g_callbacks.erase(it);
}

bool CallbacksInFlight::Inside(const LogicalCaller &caller)
{
    CSingleLock lock(&g_callbacksLock);
    return std::find(g_callbacks.begin(), g_callbacks.end(), caller) != g_callbacks.end();
}

bool CGroupActivity::EnterCall(const LogicalCaller &caller)
{
    CSingleLock lock(&m_lock);
    if (m_removing)
        return false;
    m_entries.push_back({caller, Kind::Call});
    return true;
}

void CGroupActivity::LeaveCall(const LogicalCaller &caller)
{
    Remove(caller, Kind::Call);
}

CGroupActivity::Kind CGroupActivity::BeginCallback(const LogicalCaller &caller)
{
    CSingleLock lock(&m_lock);
    bool inCall = std::any_of(m_entries.begin(), m_entries.end(),
                              [&](const Entry &e) { return e.kind == Kind::Call && e.caller == caller; });
    Kind kind = inCall ? Kind::CallCallback : Kind::WorkCallback;
    m_entries.push_back({caller, kind});
    return kind;
}

void CGroupActivity::EndCallback(const LogicalCaller &caller, Kind kind)
{
    Remove(caller, kind);
}

void CGroupActivity::Remove(const LogicalCaller &caller, Kind kind)
{
    CSingleLock lock(&m_lock);
    auto it = std::find_if(m_entries.begin(), m_entries.end(),
                           [&](const Entry &e) { return e.kind == kind && e.caller == caller; });
    if (it != m_entries.end())
        m_entries.erase(it);
    Changed();
}

void CGroupActivity::AddWork()
{
    CSingleLock lock(&m_lock);
    ++m_work;
}

bool CGroupActivity::ReleaseWork()
{
    CSingleLock lock(&m_lock);
    --m_work;
    bool handOver = m_removalsWaiting > 0;
    if (handOver)
        ++m_handedOver;
    Changed();
    return handOver;
}

bool CGroupActivity::Removing()
{
    CSingleLock lock(&m_lock);
    return m_removing;
}

void CGroupActivity::MarkRemoving()
{
    CSingleLock lock(&m_lock);
    m_removing = true;
}

void CGroupActivity::Changed()
{
    if (m_removalsWaiting > 0)
        WakeAllConditionVariable(&m_changed);
}

LONG CGroupActivity::WaitForRemoval(const LogicalCaller &remover)
{
    CSingleLock lock(&m_lock);
    ++m_removalsWaiting;
    while (Blocking(remover) > 0)
        if (!SleepConditionVariableCS(&m_changed, m_lock.Native(), INFINITE))
            INTERNAL_ASSERT_FAILED("wait for the group's work");
    --m_removalsWaiting;
    return m_removalsWaiting == 0 ? std::exchange(m_handedOver, 0) : 0;
}

LONG CGroupActivity::Blocking(const LogicalCaller &remover) const
{
    bool nested = CallbacksInFlight::Inside(remover);
    LONG blocking = m_work;
    for (const Entry &e : m_entries) {
        bool own = e.caller == remover;
        switch (e.kind) {
        case Kind::Call: // counted unless it is the remover's own
            if (!own)
                ++blocking;
            break;
        case Kind::WorkCallback: // its work unit is not waited for
            if (nested || own)
                --blocking;
            break;
        case Kind::CallCallback: // its call is not waited for
            if (nested && !own)
                --blocking;
            break;
        }
    }
    return blocking;
}

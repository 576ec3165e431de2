#include "UpdateScanMgr.h"

#include "Delivery.h"
#include "OPCGroup.h"
#include "Trace.h"

#include <algorithm>

namespace {
// Read once at start-up: ticks per millisecond, and one millisecond of slack.
struct TimeBase {
    LONGLONG ticksPerMs;
    LONGLONG dueSlack;
    TimeBase()
    {
        LARGE_INTEGER f;
        QueryPerformanceFrequency(&f);
        ticksPerMs = f.QuadPart / 1000;
        dueSlack = static_cast<LONGLONG>(static_cast<ULONGLONG>(static_cast<DWORD>(ticksPerMs)));
    }
};
const TimeBase g_time;

} // namespace

bool CUpdateScanMgr::Later(const Entry &a, const Entry &b)
{
    return a.due > b.due; // the heap keeps the smallest due time at the front
}

LONGLONG CUpdateScanMgr::Now()
{
    LARGE_INTEGER now;
    QueryPerformanceCounter(&now);
    return now.QuadPart;
}

LONGLONG CUpdateScanMgr::TicksPerMs()
{
    return g_time.ticksPerMs;
}

CUpdateScanMgr::CUpdateScanMgr()
    : m_columns(std::make_unique<Delivery>(0)), m_wake(CreateEventW(nullptr, FALSE, FALSE, nullptr))
{
    if (!m_wake)
        INTERNAL_ASSERT_FAILED("CreateEvent for the scanner's wake event");
}

CUpdateScanMgr::~CUpdateScanMgr()
{
    // A scan in progress (its callbacks included) ends first; the thread
    // then lets go of every queued group.
    m_thread.Stop();
}

HRESULT CUpdateScanMgr::Start()
{
    HRESULT hr = m_thread.Start(L"update scanner", [this](HANDLE stop) { Run(stop); });
    if (FAILED(hr))
        INTERNAL_ASSERT_FAILED("scanner thread");
    return S_OK;
}

void CUpdateScanMgr::Push(COPCGroup *group, LONGLONG due)
{
    m_heap.push_back({group, due});
    std::push_heap(m_heap.begin(), m_heap.end(), Later);
}

void CUpdateScanMgr::Schedule(COPCGroup *group, LONGLONG due, bool wake)
{
    CSingleLock lock(&m_lock);
    Push(group, due);
    if (wake && !SetEvent(m_wake.Get()))
        INTERNAL_ASSERT_FAILED("SetEvent for the scanner's wake event");
}

bool CUpdateScanMgr::Unschedule(COPCGroup *group)
{
    CSingleLock lock(&m_lock);
    auto it = std::find_if(m_heap.begin(), m_heap.end(), [group](const Entry &e) { return e.group == group; });
    if (it == m_heap.end())
        return false;
    m_heap.erase(it);
    std::make_heap(m_heap.begin(), m_heap.end(), Later);
    return true;
}

bool CUpdateScanMgr::ShiftDue(COPCGroup *group, DWORD oldRate, DWORD newRate)
{
    CSingleLock lock(&m_lock);
    auto it = std::find_if(m_heap.begin(), m_heap.end(), [group](const Entry &e) { return e.group == group; });
    if (it == m_heap.end())
        return false;
    if (newRate > oldRate)
        it->due += static_cast<LONGLONG>(newRate - oldRate) * g_time.ticksPerMs;
    else
        it->due -= static_cast<LONGLONG>(oldRate - newRate) * g_time.ticksPerMs;
    if (m_heap.size() >= 2)
        std::make_heap(m_heap.begin(), m_heap.end(), Later);
    SetEvent(m_wake.Get());
    return true;
}

COPCGroup *CUpdateScanMgr::WaitForDueGroup(HANDLE stopEvent)
{
    DWORD timeout = INFINITE;
    DWORD result = WAIT_OBJECT_0 + 1;
    for (;;) {
        if (result == WAIT_OBJECT_0)
            return nullptr;
        if (result == WAIT_OBJECT_0 + 1 || result == WAIT_TIMEOUT) {
            CSingleLock lock(&m_lock);
            if (m_heap.empty()) {
                timeout = INFINITE;
            } else {
                LONGLONG remaining = m_heap.front().due - Now();
                if (remaining <= g_time.dueSlack) {
                    COPCGroup *group = m_heap.front().group;
                    std::pop_heap(m_heap.begin(), m_heap.end(), Later);
                    m_heap.pop_back();
                    return group; // its reference and work unit pass to the caller
                }
                timeout = static_cast<DWORD>(remaining / g_time.ticksPerMs);
            }
        } else {
            INTERNAL_ASSERT_FAILED("unexpected wait result in the scanner");
        }
        HANDLE events[] = {stopEvent, m_wake.Get()}; // a stop wins over a wake
        result = WaitForMultipleObjects(2, events, FALSE, timeout);
    }
}

COPCGroup *CUpdateScanMgr::TakeAny()
{
    CSingleLock lock(&m_lock);
    if (m_heap.empty())
        return nullptr;
    COPCGroup *group = m_heap.front().group;
    std::pop_heap(m_heap.begin(), m_heap.end(), Later);
    m_heap.pop_back();
    return group;
}

void CUpdateScanMgr::ScanOne(COPCGroup *group)
{
    LONGLONG next = 0;
    if (group->Scan(next, *m_columns)) {
        group->SetFailedScans(0);
    } else if (group->IncrementFailedScans() >= 3) {
        // Deactivated first: the entry's reference still keeps it alive.
        group->SetActive(FALSE);
        group->ReleaseWork();
        return;
    }
    CSingleLock lock(&m_lock);
    Push(group, next);
    if (--m_yield == 0) {
        m_yield = 100;
        Sleep(0);
    }
}

void CUpdateScanMgr::Run(HANDLE stopEvent)
{
    while (COPCGroup *group = WaitForDueGroup(stopEvent))
        ScanOne(group);
    while (COPCGroup *group = TakeAny())
        group->ReleaseWork(); // the groups keep their active flag
}

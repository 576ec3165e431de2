#pragma once
// The update scanner: one process-wide thread that visits every active group
// at its update rate (a min-heap of due times in performance-counter ticks)
// and lets the group deliver its changed items. Reference-counted; every
// server object holds one reference.
#include "RefSingleton.h"
#include "WorkerThread.h"

#include <memory>
#include <vector>

class COPCGroup;
struct Delivery;

class CUpdateScanMgr {
public:
    static HRESULT Acquire(CUpdateScanMgr **out) { return Singleton::Acquire(out); }
    static void ReleaseInstance() { Singleton::ReleaseInstance(); }
    static LONG RefCount() { return Singleton::RefCount(); }
    static CUpdateScanMgr *Instance() { return Singleton::Instance(); }

    CUpdateScanMgr();
    ~CUpdateScanMgr();
    HRESULT Start();

    // The entry holds one COM reference and one pending work unit of the
    // group, which the caller has taken. wake: the thread looks again now.
    void Schedule(COPCGroup *group, LONGLONG due, bool wake);
    // Removes the group's entry (the caller then gives back its reference
    // and work unit); false when none is queued (for instance in flight).
    bool Unschedule(COPCGroup *group);
    // Moves the group's next scan by the change of its rate.
    bool ShiftDue(COPCGroup *group, DWORD oldRate, DWORD newRate);

    static LONGLONG Now();
    static LONGLONG TicksPerMs();

private:
    using Singleton = CRefSingleton<CUpdateScanMgr>;
    struct Entry {
        COPCGroup *group;
        LONGLONG due;
    };
    static bool Later(const Entry &a, const Entry &b);
    void Run(HANDLE stopEvent);
    COPCGroup *WaitForDueGroup(HANDLE stopEvent);
    COPCGroup *TakeAny();
    void Push(COPCGroup *group, LONGLONG due);
    void ScanOne(COPCGroup *group);

    CCriticalSection m_lock{LockOrder::Inner};
    std::vector<Entry> m_heap;
    int m_yield = 100;
    // The scanner thread's callback columns, lent to each scan: one set
    // for every group rather than one kept by each (some 40 bytes an item),
    // and a scan of many items neither allocates nor touches fresh pages.
    std::unique_ptr<Delivery> m_columns;
    UniqueHandle m_wake;
    CWorkerThread m_thread;
};

#pragma once
// The update scanner: one process-wide thread that visits active groups at
// their update rates. Reference-counted; every server object holds one
// reference (taken at its final construction).
#include "RefSingleton.h"
#include "WorkerThread.h"

class CUpdateScanMgr {
public:
    static HRESULT Acquire(CUpdateScanMgr **out) { return Singleton::Acquire(out); }
    static void ReleaseInstance() { Singleton::ReleaseInstance(); }
    static LONG RefCount() { return Singleton::RefCount(); }

    CUpdateScanMgr() = default;
    ~CUpdateScanMgr();
    HRESULT Start();

private:
    using Singleton = CRefSingleton<CUpdateScanMgr>;
    void Run(HANDLE stopEvent);

    CWorkerThread m_thread;
};

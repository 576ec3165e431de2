#pragma once
// The asynchronous I/O manager: one process-wide worker thread that executes
// queued transactions one at a time, first in first out. Reference-counted;
// every server object holds one reference (taken at its final construction).
#include "RefSingleton.h"
#include "WorkerThread.h"

class CAsyncIOMgr {
public:
    static HRESULT Acquire(CAsyncIOMgr **out) { return Singleton::Acquire(out); }
    static void ReleaseInstance() { Singleton::ReleaseInstance(); }
    static LONG RefCount() { return Singleton::RefCount(); }

    CAsyncIOMgr() = default;
    ~CAsyncIOMgr();
    HRESULT Start();

private:
    using Singleton = CRefSingleton<CAsyncIOMgr>;
    void Run(HANDLE stopEvent);

    CWorkerThread m_thread;
};

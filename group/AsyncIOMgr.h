#pragma once
// The asynchronous I/O manager: one process-wide worker thread that executes
// queued transactions one at a time, first in first out, across all groups
// and clients. Reference-counted; every server object holds one reference.
#include "RefSingleton.h"
#include "WorkerThread.h"

#include <list>
#include <memory>

class COPCGroup;
class CTransaction;

class CAsyncIOMgr {
public:
    static HRESULT Acquire(CAsyncIOMgr **out) { return Singleton::Acquire(out); }
    static void ReleaseInstance() { Singleton::ReleaseInstance(); }
    static LONG RefCount() { return Singleton::RefCount(); }
    static CAsyncIOMgr *Instance() { return Singleton::Instance(); }

    CAsyncIOMgr();
    ~CAsyncIOMgr();
    HRESULT Start();

    void Enqueue(std::unique_ptr<CTransaction> transaction);
    std::unique_ptr<CTransaction> TakeNext();
    // The queued transaction of group with that id; null when none is
    // queued (never issued, another group's, or already taken by the worker).
    std::unique_ptr<CTransaction> RemoveById(DWORD id, const COPCGroup *group);
    // Destroys every queued transaction of group unexecuted (its removal).
    void RemoveAllOf(const COPCGroup *group);

private:
    using Singleton = CRefSingleton<CAsyncIOMgr>;
    void Run(HANDLE stopEvent);

    CCriticalSection m_lock{LockOrder::Inner}; // the queue only; never held while executing
    std::list<std::unique_ptr<CTransaction>> m_queue;
    UniqueHandle m_work; // manual reset: signalled while the queue is not empty
    CWorkerThread m_thread;
};

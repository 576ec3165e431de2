#include "AsyncIOMgr.h"

#include "Trace.h"

CAsyncIOMgr::~CAsyncIOMgr()
{
    m_thread.Stop();
    Trace("asynchronous I/O manager stopped\n");
}

HRESULT CAsyncIOMgr::Start()
{
    Trace("asynchronous I/O manager starting\n");
    return m_thread.Start([this](HANDLE stop) { Run(stop); });
}

void CAsyncIOMgr::Run(HANDLE stopEvent)
{
    // The transaction queue arrives with asynchronous I/O; until then the thread
    // only waits to be stopped.
    WaitForSingleObject(stopEvent, INFINITE);
}

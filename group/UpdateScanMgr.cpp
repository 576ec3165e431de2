#include "UpdateScanMgr.h"

#include "Trace.h"

CUpdateScanMgr::~CUpdateScanMgr()
{
    m_thread.Stop();
    Trace("update scanner stopped\n");
}

HRESULT CUpdateScanMgr::Start()
{
    Trace("update scanner starting\n");
    return m_thread.Start([this](HANDLE stop) { Run(stop); });
}

void CUpdateScanMgr::Run(HANDLE stopEvent)
{
    // The scan queue arrives with subscriptions; until then the thread only
    // waits to be stopped.
    WaitForSingleObject(stopEvent, INFINITE);
}

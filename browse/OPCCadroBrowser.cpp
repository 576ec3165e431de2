#include "OPCCadroBrowser.h"

#include "Trace.h"

#include <new>

OPCCadroBrowser *OPCCadroBrowser::Create()
{
    return new (std::nothrow) OPCCadroBrowser();
}

HRESULT OPCCadroBrowser::Init()
{
    // The browse session is opened once the network libraries are linked.
    m_open = true;
    Trace("browser receiver initialised\n");
    return S_OK;
}

void OPCCadroBrowser::Shutdown()
{
    m_open = false;
    Trace("browser receiver shut down\n");
}

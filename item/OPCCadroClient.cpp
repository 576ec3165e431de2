#include "OPCCadroClient.h"

#include "Trace.h"

#include <new>

OPCCadroClient *OPCCadroClient::Create()
{
    return new (std::nothrow) OPCCadroClient();
}

HRESULT OPCCadroClient::Init()
{
    // The real-time session is opened once the network libraries are linked.
    m_open = true;
    Trace("real-time client initialised\n");
    return S_OK;
}

void OPCCadroClient::Shutdown()
{
    m_open = false;
    Trace("real-time client shut down\n");
}

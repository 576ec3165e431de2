#include "Services.h"

#include "AddrSpace.h"
#include "ItemServices.h"
#include "OPCCadroBrowser.h"
#include "OPCCadroClient.h"
#include "SyncObject.h"
#include "Trace.h"

#include <memory>

namespace {
CCriticalSection g_servicesLock;
LONG g_serverCount = 0;
OPCCadroClient *g_realTimeClient = nullptr;
OPCCadroBrowser *g_browser = nullptr;
// Kept until the process ends once built.
std::unique_ptr<CAddrSpace> g_addrSpace;

// Creates, publishes and initialises one service; the success of the
// initialisation is not examined (a failed session reports itself).
template <class Service> void StartService(Service *&slot)
{
    Service *service = Service::Create();
    if (!service) {
        INTERNAL_ASSERT_FAILED("service allocation");
        return;
    }
    slot = service;
    service->Init();
    service->AddRef();
}

template <class Service> void StopService(Service *&slot)
{
    if (!slot)
        return;
    slot->Shutdown();
    slot->Release();
    slot = nullptr;
}
} // namespace

void ServerServices::ServerConstructed()
{
    CSingleLock lock(&g_servicesLock);
    if (g_serverCount == 0) {
        if (!g_addrSpace) {
            g_addrSpace.reset(CAddrSpace::Create());
            if (!g_addrSpace || FAILED(g_addrSpace->Build()))
                INTERNAL_ASSERT_FAILED("address space construction");
        }
        StartService(g_realTimeClient);
        ItemServices::SetRealTimeClient(g_realTimeClient);
        StartService(g_browser);
    }
    ++g_serverCount;
}

void ServerServices::ServerReleased()
{
    CSingleLock lock(&g_servicesLock);
    if (--g_serverCount == 0) {
        ItemServices::SetRealTimeClient(nullptr);
        StopService(g_realTimeClient);
        StopService(g_browser);
    }
}

LONG ServerServices::ServerObjectCount()
{
    CSingleLock lock(&g_servicesLock);
    return g_serverCount;
}

OPCCadroClient *ServerServices::RealTimeClient()
{
    return g_realTimeClient;
}

OPCCadroBrowser *ServerServices::BrowserReceiver()
{
    return g_browser;
}

CAddrSpace *ServerServices::AddressSpace()
{
    return g_addrSpace.get();
}

#include "Services.h"

#include "AddrSpace.h"
#include "ItemServices.h"
#include "OPCCadroBrowser.h"
#include "OPCCadroClient.h"
#include "SyncObject.h"
#include "Trace.h"

#include <memory>

namespace {
CCriticalSection g_servicesLock(LockOrder::Services);
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
// The tree reaches the network through the current browser receiver.
bool CurrentBrowser(CAddrSpace::Browser &browser)
{
    OPCCadroBrowser *current = OPCCadroBrowser::AcquireCurrent();
    if (!current)
        return false;
    browser.release = [current] { current->Release(); };
    browser.open = [current](const wchar_t *url) { return current->Open(url); };
    browser.next = [current](BrowseRecord *record) { return current->Next(kBrowseFieldMask, record); };
    return true;
}

// A browse session of its own for each reader of a read-ahead.
bool SessionBrowser(CAddrSpace::Browser &browser)
{
    OPCCadroBrowser *current = OPCCadroBrowser::AcquireCurrent();
    CadroBrowser *session = current ? current->NewSession() : nullptr;
    if (current)
        current->Release();
    if (!session)
        return false;
    browser.release = [session] { session->Release(); };
    browser.open = [session](const wchar_t *url) { return OPCCadroBrowser::OpenOn(session, url); };
    browser.next = [session](BrowseRecord *record) { return session->Next(kBrowseFieldMask, record); };
    return true;
}

void ReadAhead(const std::vector<std::wstring_view> &itemIds)
{
    if (CAddrSpace *space = g_addrSpace.get())
        space->ReadAhead(itemIds);
}

// Items take their canonical type and access rights from the tree.
bool LookupNode(std::wstring_view itemId, VARTYPE &type, DWORD &rights)
{
    CAddrSpace *space = g_addrSpace.get();
    AddrNodePtr node = space ? space->FindByItemId(itemId) : nullptr;
    if (!node)
        return false;
    type = node->DataType();
    rights = node->AccessRights();
    return true;
}

void BuildAddressSpace()
{
    std::unique_ptr<CAddrSpace> space(CAddrSpace::Create());
    if (!space || FAILED(space->Build())) {
        // Out of memory: the server goes on without an address space.
        INTERNAL_ASSERT_FAILED("address space construction");
        return;
    }
    space->SetBrowserSource(CurrentBrowser, SessionBrowser);
    g_addrSpace = std::move(space);
    ItemServices::SetNodeLookup(LookupNode);
    ItemServices::SetReadAhead(ReadAhead);
}
} // namespace

void ServerServices::ServerConstructed()
{
    CSingleLock lock(&g_servicesLock);
    if (g_serverCount == 0) {
        if (!g_addrSpace) {
            BuildAddressSpace();
        }
        StartService(g_realTimeClient);
        ItemServices::SetRealTimeClient(g_realTimeClient);
        StartService(g_browser);
        OPCCadroBrowser::SetCurrent(g_browser);
    }
    ++g_serverCount;
}

void ServerServices::ServerReleased()
{
    CSingleLock lock(&g_servicesLock);
    if (--g_serverCount == 0) {
        ItemServices::SetRealTimeClient(nullptr);
        StopService(g_realTimeClient);
        OPCCadroBrowser::SetCurrent(nullptr);
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

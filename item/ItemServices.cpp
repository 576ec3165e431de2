#include "ItemServices.h"

#include "SyncObject.h"

#include <atomic>

namespace {
CCriticalSection g_clientLock;
ComPtr<OPCCadroClient> g_client; // guarded by g_clientLock
std::atomic<ItemServices::NodeLookup> g_lookup{nullptr};
} // namespace

void ItemServices::SetRealTimeClient(OPCCadroClient *client)
{
    ComPtr<OPCCadroClient> previous(client); // the old one is released after the lock
    CSingleLock lock(&g_clientLock);
    std::swap(previous, g_client);
}

ComPtr<OPCCadroClient> ItemServices::RealTimeClient()
{
    CSingleLock lock(&g_clientLock);
    return g_client;
}

void ItemServices::SetNodeLookup(NodeLookup lookup)
{
    g_lookup = lookup;
}

bool ItemServices::FindNode(std::wstring_view itemId, VARTYPE &type, DWORD &rights)
{
    NodeLookup lookup = g_lookup;
    return lookup && lookup(itemId, type, rights);
}

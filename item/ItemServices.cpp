#include "ItemServices.h"

#include "SyncObject.h"

#include <atomic>
#include <new>

namespace {
CCriticalSection g_clientLock;
ComPtr<OPCCadroClient> g_client; // guarded by g_clientLock
std::atomic<ItemServices::NodeLookup> g_lookup{nullptr};
std::atomic<ItemServices::ReadAheadFunction> g_readAhead{nullptr};
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

void ItemServices::SetReadAhead(ReadAheadFunction readAhead)
{
    g_readAhead = readAhead;
}

void ItemServices::ReadAhead(const OPCITEMDEF *items, DWORD count)
{
    ReadAheadFunction readAhead = g_readAhead;
    if (!readAhead || count < 2)
        return;
    std::vector<std::wstring_view> ids;
    try {
        ids.reserve(count);
    } catch (const std::bad_alloc &) {
        return; // the lookups read as they go
    }
    for (DWORD i = 0; i < count; ++i)
        if (items[i].szItemID && *items[i].szItemID)
            ids.push_back(items[i].szItemID);
    readAhead(ids);
}

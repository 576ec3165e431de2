#include "ItemServices.h"

#include <atomic>

namespace {
std::atomic<OPCCadroClient *> g_client{nullptr};
std::atomic<ItemServices::NodeLookup> g_lookup{nullptr};
} // namespace

void ItemServices::SetRealTimeClient(OPCCadroClient *client)
{
    g_client = client;
}

OPCCadroClient *ItemServices::RealTimeClient()
{
    return g_client;
}

void ItemServices::SetNodeLookup(NodeLookup lookup)
{
    g_lookup = lookup;
}

bool ItemServices::FindNode(const std::wstring &itemId, VARTYPE &type, DWORD &rights)
{
    NodeLookup lookup = g_lookup;
    return lookup && lookup(itemId, type, rights);
}

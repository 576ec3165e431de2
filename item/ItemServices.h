#pragma once
// The process-wide services an item uses: the real-time client and the
// address-space lookup. The server's services install them.
#include <oaidl.h>

#include <string>

class OPCCadroClient;

namespace ItemServices {
using NodeLookup = bool (*)(const std::wstring &itemId, VARTYPE &type, DWORD &rights);

void SetRealTimeClient(OPCCadroClient *client);
OPCCadroClient *RealTimeClient();
void SetNodeLookup(NodeLookup lookup);
// The canonical type and access rights of the address-space node that the
// identifier names; false when the address space does not know it.
bool FindNode(const std::wstring &itemId, VARTYPE &type, DWORD &rights);
} // namespace ItemServices

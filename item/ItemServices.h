#pragma once
// The process-wide services an item uses: the real-time client and the
// address-space lookup. The server's services install them.
#include "ComPtr.h"
#include "OPCCadroClient.h"

#include "opcda.h"

#include <oaidl.h>

#include <string>
#include <string_view>
#include <vector>

namespace ItemServices {
using NodeLookup = bool (*)(std::wstring_view itemId, VARTYPE &type, DWORD &rights);
using ReadAheadFunction = void (*)(const std::vector<std::wstring_view> &itemIds);

// The client is held by reference: an item creation that took it keeps it
// (and the network session's end then only fails its subscription) while the
// last server's release shuts the services down.
void SetRealTimeClient(OPCCadroClient *client);
ComPtr<OPCCadroClient> RealTimeClient();
void SetNodeLookup(NodeLookup lookup);
// The canonical type and access rights of the address-space node that the
// identifier names; false when the address space does not know it.
bool FindNode(std::wstring_view itemId, VARTYPE &type, DWORD &rights);
void SetReadAhead(ReadAheadFunction readAhead);
// Within a call's pass, before the lookups of its items: the address space
// reads ahead, several at once, what they will read.
void ReadAhead(const OPCITEMDEF *items, DWORD count);
} // namespace ItemServices

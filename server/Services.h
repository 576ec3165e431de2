#pragma once
// The process-wide services that every server object shares: the real-time
// client, the browser receiver and the address space. They exist while at
// least one server object exists (the address space, once built, until the
// process ends).
#include <windows.h>

class CAddrSpace;
class OPCCadroBrowser;
class OPCCadroClient;

namespace ServerServices {
// A server object's construction is complete: the first one starts the
// services.
void ServerConstructed();
// A server object is being released: the last one stops the services, the
// real-time client first, then the browser receiver.
void ServerReleased();

LONG ServerObjectCount();
OPCCadroClient *RealTimeClient();
OPCCadroBrowser *BrowserReceiver();
CAddrSpace *AddressSpace();
} // namespace ServerServices

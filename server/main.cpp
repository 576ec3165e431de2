// Entry of the server executable: registration switches, or a COM local
// server run that lasts as its lifetime decides (ServerLifetime.h).
#include "ClassFactory.h"
#include "LocalServerRun.h"
#include "Registration.h"
#include "ServerIds.h"

int WINAPI WinMain(HINSTANCE, HINSTANCE, LPSTR, int)
{
    static CServerClassFactory factory;
    return LocalServerMain(
        CLSID_SkylarcOPCServer, factory, ServerInterfaces(), [] { return static_cast<int>(RegisterServer()); },
        [] {
            UnregisterServer();
            return 0;
        });
}

// Entry of the server executable: registration switches, or a COM local
// server run that lasts as its lifetime decides (ServerLifetime.h).
#include "ClassFactory.h"
#include "CommandLine.h"
#include "LocalServerRun.h"
#include "Registration.h"
#include "ServerIds.h"

#include <objbase.h>

int WINAPI WinMain(HINSTANCE, HINSTANCE, LPSTR, int)
{
    const char *commandLine = GetCommandLineA();
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);

    int exitCode = 0;
    switch (FindServerCommand(commandLine)) {
    case ServerCommand::UnregServer:
        UnregisterServer();
        break;
    case ServerCommand::RegServer:
        exitCode = static_cast<int>(RegisterServer());
        break;
    case ServerCommand::Run: {
        static CServerClassFactory factory;
        exitCode = RunLocalServer(CLSID_SkylarcOPCServer, factory, StartedByCom(commandLine));
        break;
    }
    }
    return EndLocalServer(exitCode);
}

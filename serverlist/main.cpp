// Entry of the server list executable: "RegServer" and "UnregServer", or a
// COM local server run of the server list class that lasts as its lifetime
// decides, as the OPC server's does (ServerLifetime.h).
//
// Exit codes of the switches: 0 done; 1 another installation's server list
// is registered and was left as it is; an HRESULT when the registry refused.
#include "CommandLine.h"
#include "LocalClassFactory.h"
#include "LocalServerRun.h"
#include "ServerList.h"
#include "ServerListIds.h"
#include "ServerListRegistration.h"

#include <objbase.h>

#include <string>

namespace {
std::wstring ModulePath()
{
    wchar_t path[MAX_PATH] = {};
    DWORD n = GetModuleFileNameW(nullptr, path, MAX_PATH);
    return std::wstring(path, n < MAX_PATH ? n : 0);
}

int SwitchResult(HRESULT hr)
{
    return FAILED(hr) ? static_cast<int>(hr) : hr == S_FALSE ? 1 : 0;
}
} // namespace

int WINAPI WinMain(HINSTANCE, HINSTANCE, LPSTR, int)
{
    const char *commandLine = GetCommandLineA();
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);

    int exitCode = 0;
    switch (FindServerCommand(commandLine)) {
    case ServerCommand::UnregServer:
        exitCode = SwitchResult(ServerListRegistration::Unregister(ModulePath()));
        break;
    case ServerCommand::RegServer:
        exitCode = SwitchResult(ServerListRegistration::Register(ModulePath()));
        break;
    case ServerCommand::Run: {
        static CLocalClassFactory factory(&COPCServerList::Create);
        exitCode = RunLocalServer(CLSID_OPCServerList, factory, StartedByCom(commandLine));
        break;
    }
    }
    return EndLocalServer(exitCode);
}

// Entry of the server executable: registration switches, or a COM local
// server run that lasts until the module lock count falls to 0.
#include "ClassFactory.h"
#include "ComModule.h"
#include "CommandLine.h"
#include "Registration.h"
#include "ServerIds.h"

#include <objbase.h>

namespace {
int RunServer()
{
    // The message queue must exist before any object can post the quit
    // message to it.
    MSG msg;
    PeekMessageA(&msg, nullptr, WM_USER, WM_USER, PM_NOREMOVE);

    static CServerClassFactory factory;
    DWORD cookie = 0;
    HRESULT hr = CoRegisterClassObject(CLSID_SkylarcOPCServer, &factory, CLSCTX_LOCAL_SERVER | CLSCTX_REMOTE_SERVER,
                                       REGCLS_MULTIPLEUSE, &cookie);
    if (FAILED(hr)) {
        // Nothing could ever create an object and end the loop: leave at
        // once with the failure instead of idling forever.
        return static_cast<int>(hr);
    }
    while (GetMessageA(&msg, nullptr, 0, 0) > 0)
        DispatchMessageA(&msg);
    CoRevokeClassObject(cookie);
    return 0;
}
} // namespace

int WINAPI WinMain(HINSTANCE, HINSTANCE, LPSTR, int)
{
    const char *commandLine = GetCommandLineA();
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    ComModule::SetMainThreadId(GetCurrentThreadId());

    int exitCode = 0;
    switch (FindServerCommand(commandLine)) {
    case ServerCommand::UnregServer:
        UnregisterServer();
        break;
    case ServerCommand::RegServer:
        exitCode = static_cast<int>(RegisterServer());
        break;
    case ServerCommand::Run:
        exitCode = RunServer();
        break;
    }
    CoUninitialize();
    return exitCode;
}

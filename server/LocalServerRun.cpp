#include "LocalServerRun.h"

#include "CallWatcher.h"
#include "ClassObjectRegistration.h"
#include "ComModule.h"
#include "CommandLine.h"
#include "ExitWatchdog.h"
#include "InterfaceAnchor.h"
#include "ServerLifetime.h"
#include "SinkRelease.h"
#include "Trace.h"

#include <objbase.h>

namespace {
// Once the process has decided to exit, the rest of its exit (COM's
// uninitialisation included) may take this long before the process is ended.
constexpr DWORD kExitBoundMs = 5000;

// Held from before the class object is registered until COM is uninitialised.
CInterfaceAnchor &Anchor()
{
    static CInterfaceAnchor anchor;
    return anchor;
}

void WaitForStep(HANDLE wake, DWORD waitMs)
{
    MsgWaitForMultipleObjects(1, &wake, FALSE, waitMs, QS_ALLINPUT);
    MSG msg;
    while (PeekMessageA(&msg, nullptr, 0, 0, PM_REMOVE))
        DispatchMessageA(&msg);
}
} // namespace

int RunLocalServer(REFCLSID clsid, IClassFactory &factory, bool startedByCom, const ExportedInterfaces &exported)
{
    // Without the anchor the server still serves, open to the freeze the
    // anchor prevents (InterfaceAnchor.h): a missing proxy/stub registration
    // is no reason to refuse clients.
    HRESULT anchored = Anchor().Hold(exported);
    if (FAILED(anchored))
        Trace("not every exported interface could be anchored: 0x%08lx\n", static_cast<unsigned long>(anchored));
    // One run per process: the lifetime and the call hook stay for the
    // process's life (COM keeps the hook). Both are in place before the
    // class object is registered: a client may create an object the moment
    // it is, and its count must go to the lifetime.
    static CClassObjectRegistration registration(clsid, factory);
    static CServerLifetime lifetime(registration, CServerLifetime::Timing(), startedByCom);
    registration.Attach(lifetime);
    ComModule::SetLifetime(&lifetime);
    static CCallWatcher watcher;
    watcher.Install();
    HRESULT hr = registration.Register(CClassRegistration::Use::Shared);
    if (FAILED(hr))
        return static_cast<int>(hr);
    DWORD waitMs = INFINITE;
    while (lifetime.Advance(waitMs) != CServerLifetime::Phase::Stopped)
        WaitForStep(lifetime.WakeEvent(), waitMs);
    return 0; // the class object is already revoked
}

int EndLocalServer(int exitCode)
{
    CExitWatchdog watchdog(kExitBoundMs, static_cast<UINT>(exitCode));
    SinkRelease::Flush(); // sinks still held a moment longer go now
    Anchor().Release();
    CoUninitialize();
    return exitCode;
}

int LocalServerMain(REFCLSID clsid, IClassFactory &factory, const ExportedInterfaces &exported, int (*registerServer)(),
                    int (*unregisterServer)())
{
    const char *commandLine = GetCommandLineA();
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    int exitCode = 0;
    switch (FindServerCommand(commandLine)) {
    case ServerCommand::UnregServer:
        exitCode = unregisterServer();
        break;
    case ServerCommand::RegServer:
        exitCode = registerServer();
        break;
    case ServerCommand::Run:
        exitCode = RunLocalServer(clsid, factory, StartedByCom(commandLine), exported);
        break;
    }
    return EndLocalServer(exitCode);
}

// Entry of the server executable: registration switches, or a COM local
// server run that lasts as its lifetime decides (ServerLifetime.h).
#include "CallWatcher.h"
#include "ClassFactory.h"
#include "ComModule.h"
#include "CommandLine.h"
#include "ExitWatchdog.h"
#include "Registration.h"
#include "ServerIds.h"
#include "ServerLifetime.h"

#include <objbase.h>

namespace {
// Once the process has decided to exit, the rest of its exit (COM's
// uninitialisation included) may take this long before the process is ended.
constexpr DWORD kExitBoundMs = 5000;

class CClassObjectRegistration : public CClassRegistration {
public:
    HRESULT Register() override
    {
        if (m_cookie != 0)
            return S_OK;
        return CoRegisterClassObject(CLSID_SkylarcOPCServer, &m_factory, CLSCTX_LOCAL_SERVER | CLSCTX_REMOTE_SERVER,
                                     REGCLS_MULTIPLEUSE, &m_cookie);
    }
    void Revoke() override
    {
        if (m_cookie != 0)
            CoRevokeClassObject(m_cookie);
        m_cookie = 0;
    }

private:
    CServerClassFactory m_factory;
    DWORD m_cookie = 0;
};

// The main thread waits for the lifetime's steps and dispatches whatever
// messages arrive meanwhile.
void WaitForStep(HANDLE wake, DWORD waitMs)
{
    MsgWaitForMultipleObjects(1, &wake, FALSE, waitMs, QS_ALLINPUT);
    MSG msg;
    while (PeekMessageA(&msg, nullptr, 0, 0, PM_REMOVE))
        DispatchMessageA(&msg);
}

int RunServer(bool startedByCom)
{
    static CClassObjectRegistration registration;
    HRESULT hr = registration.Register();
    if (FAILED(hr)) {
        // Nothing could ever create an object: leave at once with the
        // failure instead of idling forever.
        return static_cast<int>(hr);
    }
    static CServerLifetime lifetime(registration, CServerLifetime::Timing(), startedByCom);
    ComModule::SetLifetime(&lifetime);
    static CCallWatcher watcher(lifetime);
    watcher.Install();
    DWORD waitMs = INFINITE;
    while (lifetime.Advance(waitMs) != CServerLifetime::Phase::Stopped)
        WaitForStep(lifetime.WakeEvent(), waitMs);
    return 0; // the class object is already revoked
}
} // namespace

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
    case ServerCommand::Run:
        exitCode = RunServer(StartedByCom(commandLine));
        break;
    }
    CExitWatchdog watchdog(kExitBoundMs, static_cast<UINT>(exitCode));
    CoUninitialize();
    return exitCode;
}

// Entry of the server list executable: "RegServer" and "UnregServer", or a
// COM local server run of the server list class that lasts as its lifetime
// decides, as the OPC server's does (ServerLifetime.h).
//
// Exit codes of the switches: 0 done; 1 another installation's server list
// is registered and was left as it is; an HRESULT when the registry refused.
#include "LocalClassFactory.h"
#include "LocalServerRun.h"
#include "ServerList.h"
#include "ServerListIds.h"
#include "ServerListRegistration.h"

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
    static CLocalClassFactory factory(&COPCServerList::Create);
    static const ExportedInterfaces exported = {&IID_IOPCServerList, &IID_IOPCServerList2, &IID_IEnumGUID,
                                                &IID_IOPCEnumGUID};
    return LocalServerMain(
        CLSID_OPCServerList, factory, exported,
        [] { return SwitchResult(ServerListRegistration::Register(ModulePath())); },
        [] { return SwitchResult(ServerListRegistration::Unregister(ModulePath())); });
}

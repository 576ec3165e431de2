// opcdemo: creates the Skylarc OPC server out of process, adds a few groups
// and prints the server status and the group list.
#include "ComPtr.h"
#include "TaskMem.h"
#include "opcda.h"

#include <cstdio>

namespace {
const CLSID CLSID_SkylarcOPCServer = {0x5b1e7a20, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};

void PrintTime(const char *label, const FILETIME &ft)
{
    SYSTEMTIME st = {};
    if ((ft.dwLowDateTime | ft.dwHighDateTime) == 0 || !FileTimeToSystemTime(&ft, &st)) {
        printf("  %-18s -\n", label);
        return;
    }
    printf("  %-18s %04u-%02u-%02uT%02u:%02u:%02u.%03uZ\n", label, st.wYear, st.wMonth, st.wDay, st.wHour, st.wMinute,
           st.wSecond, st.wMilliseconds);
}

int Fail(const char *what, HRESULT hr)
{
    fprintf(stderr, "opcdemo: %s failed: 0x%08lX\n", what, static_cast<unsigned long>(hr));
    return 1;
}

int PrintStatus(IOPCServer *server)
{
    OPCSERVERSTATUS *raw = nullptr;
    HRESULT hr = server->GetStatus(&raw);
    if (FAILED(hr))
        return Fail("GetStatus", hr);
    TaskMem<OPCSERVERSTATUS> status(raw);
    TaskMem<wchar_t> vendor(status->szVendorInfo);
    printf("Server status\n");
    PrintTime("start time", status->ftStartTime);
    PrintTime("current time", status->ftCurrentTime);
    PrintTime("last update", status->ftLastUpdateTime);
    printf("  %-18s %s\n", "state", status->dwServerState == OPC_STATUS_RUNNING ? "running" : "not running");
    printf("  %-18s %lu\n", "groups", static_cast<unsigned long>(status->dwGroupCount));
    printf("  %-18s %u.%u build %u\n", "version", status->wMajorVersion, status->wMinorVersion, status->wBuildNumber);
    printf("  %-18s %ls\n", "vendor", vendor.Get() ? vendor.Get() : L"");
    return 0;
}

int PrintGroups(IOPCServer *server)
{
    ComPtr<IEnumString> names;
    HRESULT hr =
        server->CreateGroupEnumerator(OPC_ENUM_ALL, IID_IEnumString, reinterpret_cast<IUnknown **>(names.Out()));
    if (FAILED(hr))
        return Fail("CreateGroupEnumerator", hr);
    printf("Groups\n");
    LPOLESTR name = nullptr;
    ULONG fetched = 0;
    while (names->Next(1, &name, &fetched) == S_OK && fetched == 1) {
        TaskMem<wchar_t> owned(name);
        ComPtr<IOPCGroupStateMgt> group;
        server->GetGroupByName(name, IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(group.Out()));
        DWORD rate = 0, lcid = 0;
        BOOL active = FALSE;
        LPWSTR stateName = nullptr;
        LONG bias = 0;
        FLOAT deadband = 0;
        OPCHANDLE hClient = 0, hServer = 0;
        if (group &&
            SUCCEEDED(group->GetState(&rate, &active, &stateName, &bias, &deadband, &lcid, &hClient, &hServer))) {
            CoTaskMemFree(stateName);
            printf("  %-20ls handle %-4lu rate %-6lu ms %-8s deadband %.1f%%\n", name,
                   static_cast<unsigned long>(hServer), static_cast<unsigned long>(rate),
                   active ? "active" : "inactive", deadband);
        } else {
            printf("  %ls\n", name);
        }
    }
    return 0;
}

struct NewGroup {
    const wchar_t *name;
    DWORD rate;
    BOOL active;
};
} // namespace

int main()
{
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    int rc = 0;
    {
        ComPtr<IOPCServer> server;
        HRESULT hr = CoCreateInstance(CLSID_SkylarcOPCServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                      reinterpret_cast<void **>(server.Out()));
        if (FAILED(hr)) {
            rc = Fail("creating Tarnwell.SkylarcOPCServer", hr);
        } else {
            const NewGroup groups[] = {{L"Fast", 100, TRUE}, {L"Slow", 5000, FALSE}, {L"", 1, TRUE}};
            for (const NewGroup &wanted : groups) {
                OPCHANDLE handle = 0;
                DWORD revised = 0;
                ComPtr<IUnknown> group;
                hr = server->AddGroup(wanted.name, wanted.active, wanted.rate, 0, nullptr, nullptr, 0, &handle,
                                      &revised, IID_IOPCGroupStateMgt, group.Out());
                printf("AddGroup %-8ls -> 0x%08lX, handle %lu, rate %lu ms\n",
                       *wanted.name ? wanted.name : L"(generated)", static_cast<unsigned long>(hr),
                       static_cast<unsigned long>(handle), static_cast<unsigned long>(revised));
            }
            rc = PrintStatus(server.Get());
            if (rc == 0)
                rc = PrintGroups(server.Get());
        }
    }
    CoUninitialize();
    return rc;
}

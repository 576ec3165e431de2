// Browsing: a flat browse of a network of 100,000 members, and AddItems of
// 10,000 deep identifiers (the address-space lookup of each browses every
// level from its root down), in this process against the simulated network.
#include "CadroSim.h"
#include "ClassFactory.h"
#include "ComPtr.h"
#include "opcda.h"

#include <chrono>
#include <cstdio>
#include <string>
#include <vector>

namespace {
using Clock = std::chrono::steady_clock;
double Ms(Clock::time_point from)
{
    return std::chrono::duration<double, std::milli>(Clock::now() - from).count();
}
} // namespace

int main(int argc, char **argv)
{
    CadroSim_UseEmbeddedNetwork(); // the network of the objects made in this process
    const int objects = argc > 1 ? atoi(argv[1]) : 100;
    const int membersPerObject = argc > 2 ? atoi(argv[2]) : 1000;
    std::wstring description = L"machine $HOST\nprocess bench\n";
    for (int o = 0; o < objects; ++o) {
        description += L"object L1\\L2\\L3\\O" + std::to_wstring(o) + L"\n";
        for (int m = 0; m < membersPerObject; ++m)
            description += L"member m" + std::to_wstring(m) + L" value=1\n";
    }
    BSTR error = nullptr;
    if (CadroSim_Load(description.c_str(), &error) != S_OK) {
        fwprintf(stderr, L"load failed: %ls\n", error);
        return 1;
    }
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    {
        CServerClassFactory factory;
        ComPtr<IOPCServer> server;
        factory.CreateInstance(nullptr, IID_IOPCServer, reinterpret_cast<void **>(server.Out()));
        ComPtr<IOPCBrowseServerAddressSpace> browse;
        server.As(browse);
        browse->ChangeBrowsePosition(OPC_BROWSE_TO, L"\\\\.\\bench");
        for (int run = 0; run < 2; ++run) {
            auto start = Clock::now();
            ComPtr<IEnumString> names;
            browse->BrowseOPCItemIDs(OPC_FLAT, L"*", VT_EMPTY, 0, names.Out());
            double browseMs = Ms(start);
            ULONG total = 0, fetched = 0;
            LPOLESTR batch[256];
            while (names && SUCCEEDED(names->Next(256, batch, &fetched)) && fetched) {
                total += fetched;
                for (ULONG i = 0; i < fetched; ++i)
                    CoTaskMemFree(batch[i]);
            }
            printf("flat browse of %d members (%s): %.0f ms, %lu names\n", objects * membersPerObject,
                   run == 0 ? "tree built" : "tree merged", browseMs, total);
        }

        ComPtr<IOPCItemMgt> items;
        OPCHANDLE hGroup;
        DWORD rate;
        server->AddGroup(L"deep", TRUE, 1000, 0, nullptr, nullptr, 0, &hGroup, &rate, IID_IOPCItemMgt,
                         reinterpret_cast<IUnknown **>(items.Out()));
        const DWORD count = 10000;
        std::vector<std::wstring> ids;
        for (DWORD i = 0; i < count; ++i)
            ids.push_back(L"\\\\.\\bench\\L1\\L2\\L3\\O" + std::to_wstring(i % objects) + L".m" +
                          std::to_wstring((i / objects) % membersPerObject));
        std::vector<OPCITEMDEF> defs(count);
        for (DWORD i = 0; i < count; ++i) {
            defs[i] = {};
            defs[i].szItemID = const_cast<wchar_t *>(ids[i].c_str());
        }
        OPCITEMRESULT *results = nullptr;
        HRESULT *errors = nullptr;
        auto start = Clock::now();
        HRESULT hr = items->AddItems(count, defs.data(), &results, &errors);
        printf("AddItems of %lu deep identifiers: %.0f ms (0x%08lX)\n", static_cast<unsigned long>(count), Ms(start),
               static_cast<unsigned long>(hr));
        CoTaskMemFree(results);
        CoTaskMemFree(errors);
        server->RemoveGroup(hGroup, TRUE);
    }
    CoUninitialize();
    return 0;
}

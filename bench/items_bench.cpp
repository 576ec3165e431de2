// Items: AddItems of 10,000 items into one group, and a synchronous cache
// Read of 1,000 items that have values, in this process (server side) and
// across the process boundary through COM.
#include "ClassFactory.h"
#include "ComPtr.h"
#include "opcda.h"

#include <chrono>
#include <cstdio>
#include <string>
#include <vector>

namespace {
using Clock = std::chrono::steady_clock;
const CLSID kServer = {0x5b1e7a20, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};
const wchar_t *const kMembers[] = {L"temperature", L"enabled", L"label", L"code", L"limit", L"command"};

double Ms(Clock::time_point from)
{
    return std::chrono::duration<double, std::milli>(Clock::now() - from).count();
}

void Run(const char *where, IOPCServer *server)
{
    ComPtr<IOPCItemMgt> items;
    OPCHANDLE hGroup;
    DWORD rate;
    server->AddGroup(L"bench", TRUE, 1000, 0, nullptr, nullptr, 0, &hGroup, &rate, IID_IOPCItemMgt,
                     reinterpret_cast<IUnknown **>(items.Out()));
    ComPtr<IOPCSyncIO> io;
    items.As(io);

    const DWORD count = 10000;
    std::vector<std::wstring> ids;
    std::vector<OPCITEMDEF> defs(count);
    for (DWORD i = 0; i < count; ++i)
        ids.push_back(std::wstring(L"\\\\.\\proc1\\Setpoints.") + kMembers[i % 6]);
    for (DWORD i = 0; i < count; ++i) {
        defs[i] = {};
        defs[i].szItemID = const_cast<wchar_t *>(ids[i].c_str());
        defs[i].bActive = TRUE;
        defs[i].hClient = i;
    }
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    auto start = Clock::now();
    HRESULT hr = items->AddItems(count, defs.data(), &results, &errors);
    double addMs = Ms(start);
    std::vector<OPCHANDLE> handles(count);
    for (DWORD i = 0; i < count; ++i)
        handles[i] = results[i].hServer;
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
    printf("%-14s AddItems of %lu items: %.1f ms (0x%08lX)\n", where, static_cast<unsigned long>(count), addMs,
           static_cast<unsigned long>(hr));

    // 1,000 readable items that have values (limit, temperature, label...).
    std::vector<OPCHANDLE> readable;
    for (DWORD i = 0; readable.size() < 1000; ++i)
        if (i % 6 != 5) // "command" is write-only
            readable.push_back(handles[i]);
    OPCITEMSTATE *states = nullptr;
    io->Read(OPC_DS_CACHE, 1000, readable.data(), &states, &errors); // first values in
    for (int i = 0; i < 1000; ++i)
        VariantClear(&states[i].vDataValue);
    CoTaskMemFree(states);
    CoTaskMemFree(errors);
    double best = 1e9, total = 0;
    const int runs = 20;
    for (int run = 0; run < runs; ++run) {
        start = Clock::now();
        hr = io->Read(OPC_DS_CACHE, 1000, readable.data(), &states, &errors);
        double ms = Ms(start);
        best = ms < best ? ms : best;
        total += ms;
        for (int i = 0; i < 1000; ++i)
            VariantClear(&states[i].vDataValue);
        CoTaskMemFree(states);
        CoTaskMemFree(errors);
    }
    printf("%-14s cache Read of 1000 items: best %.2f ms, mean %.2f ms (0x%08lX)\n", where, best, total / runs,
           static_cast<unsigned long>(hr));
    server->RemoveGroup(hGroup, TRUE);
}
} // namespace

int main()
{
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    {
        CServerClassFactory factory;
        ComPtr<IOPCServer> local;
        factory.CreateInstance(nullptr, IID_IOPCServer, reinterpret_cast<void **>(local.Out()));
        Run("in-process", local.Get());
    }
    {
        ComPtr<IOPCServer> remote;
        HRESULT hr = CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                      reinterpret_cast<void **>(remote.Out()));
        if (SUCCEEDED(hr))
            Run("out-of-process", remote.Get());
        else
            printf("out-of-process: server not registered (0x%08lX)\n", static_cast<unsigned long>(hr));
    }
    CoUninitialize();
    return 0;
}

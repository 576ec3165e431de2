// Subscriptions: the scan cost per unchanged active item, items delivered
// per second through OnDataChange when every item changes every scan (in
// process and through COM), and the latency from a publish on the network to
// the client's OnDataChange at a 10 ms update rate.
#include "CadroSim.h"
#include "ClassFactory.h"
#include "ComPtr.h"
#include "OPCGroup.h"
#include "opcda.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <ocidl.h>
#include <string>
#include <vector>

namespace {
using Clock = std::chrono::steady_clock;
const CLSID kServer = {0x5b1e7a20, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};

class CountingSink : public IOPCDataCallback {
public:
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override
    {
        if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IOPCDataCallback)) {
            *ppv = this;
            return S_OK;
        }
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    STDMETHODIMP_(ULONG) AddRef() override { return 2; }
    STDMETHODIMP_(ULONG) Release() override { return 1; }
    STDMETHODIMP OnDataChange(DWORD, OPCHANDLE, HRESULT, HRESULT, DWORD count, OPCHANDLE *, VARIANT *values, WORD *,
                              FILETIME *, HRESULT *) override
    {
        items += count;
        if (count && V_VT(&values[0]) == VT_R8)
            last = V_R8(&values[0]);
        return S_OK;
    }
    STDMETHODIMP OnReadComplete(DWORD, OPCHANDLE, HRESULT, HRESULT, DWORD, OPCHANDLE *, VARIANT *, WORD *, FILETIME *,
                                HRESULT *) override
    {
        return S_OK;
    }
    STDMETHODIMP OnWriteComplete(DWORD, OPCHANDLE, HRESULT, DWORD, OPCHANDLE *, HRESULT *) override { return S_OK; }
    STDMETHODIMP OnCancelComplete(DWORD, OPCHANDLE) override { return S_OK; }
    std::atomic<unsigned long long> items{0};
    std::atomic<double> last{-1};
};

struct Group {
    ComPtr<IOPCItemMgt> items;
    ComPtr<IConnectionPoint> point;
    OPCHANDLE handle = 0;
    DWORD cookie = 0;
};

Group MakeGroup(IOPCServer *server, DWORD rate, const wchar_t *id, DWORD count, CountingSink *sink)
{
    Group g;
    DWORD revised;
    server->AddGroup(L"", TRUE, rate, 1, nullptr, nullptr, 0, &g.handle, &revised, IID_IOPCItemMgt,
                     reinterpret_cast<IUnknown **>(g.items.Out()));
    std::vector<OPCITEMDEF> defs(count);
    for (DWORD i = 0; i < count; ++i) {
        defs[i] = {};
        defs[i].szItemID = const_cast<wchar_t *>(id);
        defs[i].bActive = TRUE;
        defs[i].hClient = i;
    }
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    g.items->AddItems(count, defs.data(), &results, &errors);
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
    if (sink) {
        ComPtr<IConnectionPointContainer> container;
        g.items.As(container);
        container->FindConnectionPoint(IID_IOPCDataCallback, g.point.Out());
        g.point->Advise(sink, &g.cookie);
    }
    return g;
}

void Throughput(const char *where, IOPCServer *server)
{
    for (DWORD n : {100u, 1000u, 10000u}) {
        CountingSink sink;
        // "fast" counts every 10 ms: every item changes every 10 ms scan.
        Group g = MakeGroup(server, 10, L"\\\\.\\proc1\\Counters.fast", n, &sink);
        Sleep(500);
        FILETIME k0, u0, k1, u1, ignored;
        unsigned long long before = sink.items;
        auto start = Clock::now();
        Sleep(3000);
        double seconds = std::chrono::duration<double>(Clock::now() - start).count();
        unsigned long long delivered = sink.items - before;
        ComPtr<IOPCGroupStateMgt> gs;
        g.items.As(gs);
        DWORD r, lcid;
        BOOL active = FALSE;
        LPWSTR name = nullptr;
        LONG bias;
        FLOAT db;
        OPCHANDLE c, h;
        gs->GetState(&r, &active, &name, &bias, &db, &lcid, &c, &h);
        CoTaskMemFree(name);
        printf("%-14s N=%-6lu %10.0f items/s delivered%s\n", where, static_cast<unsigned long>(n), delivered / seconds,
               active ? "" : " (the group was deactivated: deliveries failed)");
        (void)k0, (void)u0, (void)k1, (void)u1, (void)ignored;
        g.point->Unadvise(g.cookie);
        server->RemoveGroup(g.handle, TRUE);
    }
}
} // namespace

int main()
{
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    {
        CServerClassFactory factory;
        ComPtr<IOPCServer> server;
        factory.CreateInstance(nullptr, IID_IOPCServer, reinterpret_cast<void **>(server.Out()));

        // Scan cost per unchanged active item: a group whose scanner visits it
        // hourly, scanned here directly once its first scan is done.
        const DWORD n = 10000;
        Group quiet = MakeGroup(server.Get(), 3600000, L"\\\\.\\proc1\\Setpoints.limit", n, nullptr);
        Sleep(300);
        ComPtr<IOPCGroupStateMgt> state;
        quiet.items.As(state);
        auto *group = static_cast<COPCGroup *>(state.Get());
        LONGLONG next = 0;
        group->Scan(next);
        const int scans = 200;
        auto start = Clock::now();
        for (int i = 0; i < scans; ++i)
            group->Scan(next);
        double ns = std::chrono::duration<double, std::nano>(Clock::now() - start).count() / (double(scans) * n);
        printf("scan cost per unchanged active item: %.1f ns (%lu items, %d scans)\n", ns,
               static_cast<unsigned long>(n), scans);
        server->RemoveGroup(quiet.handle, TRUE);

        // Latency from a publish to OnDataChange at a 10 ms rate.
        CountingSink sink;
        Group g = MakeGroup(server.Get(), 10, L"\\\\.\\proc1\\Setpoints.temperature", 1, &sink);
        Sleep(200);
        std::vector<double> ms;
        for (int i = 0; i < 300; ++i) {
            double value = 1000 + i;
            std::wstring command = L"publish \\\\.\\proc1\\Setpoints.temperature " + std::to_wstring(i + 1000);
            BSTR answer = nullptr;
            auto t0 = Clock::now();
            CadroSim_Execute(command.c_str(), &answer);
            while (sink.last.load() != value && Clock::now() - t0 < std::chrono::seconds(2))
                Sleep(0);
            ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - t0).count());
            SysFreeString(answer);
            Sleep(3); // publish at varying phases of the scan period
        }
        std::sort(ms.begin(), ms.end());
        printf("publish to OnDataChange at 10 ms: median %.2f ms, 99th percentile %.2f ms\n", ms[ms.size() / 2],
               ms[ms.size() * 99 / 100]);
        g.point->Unadvise(g.cookie);
        server->RemoveGroup(g.handle, TRUE);

        Throughput("in-process", server.Get());
    }
    {
        ComPtr<IOPCServer> remote;
        if (SUCCEEDED(CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                       reinterpret_cast<void **>(remote.Out()))))
            Throughput("out-of-process", remote.Get());
        else
            printf("out-of-process: server not registered\n");
    }
    CoUninitialize();
    return 0;
}

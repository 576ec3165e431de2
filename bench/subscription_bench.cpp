// Subscriptions: the scan cost per unchanged active item, the latency from a
// publish on the network to the client's OnDataChange at a 10 ms update rate,
// and items delivered per second through OnDataChange when every item changes
// every scan, with the server's processor time per item: in process, and
// through COM side by side with a baseline server that only sends
// precomputed calls (baseline_server.cpp).
#include "CadroSim.h"
#include "ClassFactory.h"
#include "ComPtr.h"
#include "Handle.h"
#include "OPCGroup.h"
#include "opcda.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <ocidl.h>
#include <string>
#include <tlhelp32.h>
#include <vector>

namespace {
using Clock = std::chrono::steady_clock;
const CLSID kServer = {0x5b1e7a20, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};

class CountingSink : public CComObjectRoot, public IOPCDataCallback {
public:
    DECLARE_COM_UNKNOWN()
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

    static ComPtr<CountingSink> Create()
    {
        ComPtr<CountingSink> sink(NewComObject<CountingSink>());
        return sink;
    }

    std::atomic<unsigned long long> items{0};
    std::atomic<double> last{-1};

private:
    void *FindInterface(REFIID riid) override
    {
        return IsEqualIID(riid, IID_IOPCDataCallback) ? static_cast<IOPCDataCallback *>(this) : nullptr;
    }
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

// Processor time (kernel and user) a process has used so far, in seconds.
double CpuSeconds(HANDLE process)
{
    FILETIME created, exited, kernel, user;
    if (!process || !GetProcessTimes(process, &created, &exited, &kernel, &user))
        return 0;
    auto seconds = [](const FILETIME &t) {
        return ((static_cast<ULONGLONG>(t.dwHighDateTime) << 32) | t.dwLowDateTime) / 1e7;
    };
    return seconds(kernel) + seconds(user);
}

struct Delivery {
    double itemsPerSecond = 0;
    double cpuMicrosPerItem = 0;
    bool stayedActive = true;
};

// Counts what the sink receives for five seconds, after a warm-up.
Delivery Measure(CountingSink *sink, HANDLE serverProcess)
{
    Sleep(500);
    unsigned long long before = sink->items;
    double cpuBefore = CpuSeconds(serverProcess);
    auto start = Clock::now();
    Sleep(5000);
    Delivery d;
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    unsigned long long delivered = sink->items - before;
    d.itemsPerSecond = delivered / seconds;
    if (delivered)
        d.cpuMicrosPerItem = (CpuSeconds(serverProcess) - cpuBefore) * 1e6 / delivered;
    return d;
}

// Our server: one active group of n items that all change every 10 ms scan
// ("fast" counts every 10 ms).
Delivery OurServer(IOPCServer *server, DWORD n, HANDLE serverProcess)
{
    ComPtr<CountingSink> sink = CountingSink::Create();
    Group g = MakeGroup(server, 10, L"\\\\.\\proc1\\Counters.fast", n, sink.Get());
    Delivery d = Measure(sink.Get(), serverProcess);
    ComPtr<IOPCGroupStateMgt> gs;
    g.items.As(gs);
    DWORD rate, lcid;
    BOOL active = FALSE;
    LPWSTR name = nullptr;
    LONG bias;
    FLOAT deadband;
    OPCHANDLE client, handle;
    gs->GetState(&rate, &active, &name, &bias, &deadband, &lcid, &client, &handle);
    CoTaskMemFree(name);
    d.stayedActive = active != FALSE;
    g.point->Unadvise(g.cookie);
    g = Group();
    gs.Reset();
    server->RemoveGroup(handle, TRUE);
    return d;
}

// The baseline: a process of its own that sends precomputed OnDataChange
// calls of n items at the same rate (see baseline_server.cpp).
Delivery Baseline(DWORD n)
{
    wchar_t exe[MAX_PATH];
    GetModuleFileNameW(nullptr, exe, MAX_PATH);
    std::wstring path(exe);
    path = path.substr(0, path.find_last_of(L"\\/") + 1) + L"baseline_server.exe";
    std::wstring command = L"\"" + path + L"\" " + std::to_wstring(n) + L" " + std::to_wstring(GetCurrentProcessId());

    SECURITY_ATTRIBUTES inherit = {sizeof(inherit), nullptr, TRUE};
    HANDLE readEnd = nullptr, writeEnd = nullptr;
    CreatePipe(&readEnd, &writeEnd, &inherit, 0);
    UniqueHandle reader(readEnd), writer(writeEnd);
    SetHandleInformation(readEnd, HANDLE_FLAG_INHERIT, 0);
    STARTUPINFOW si = {};
    si.cb = sizeof(si);
    si.dwFlags = STARTF_USESTDHANDLES;
    si.hStdOutput = writeEnd;
    si.hStdError = GetStdHandle(STD_ERROR_HANDLE);
    PROCESS_INFORMATION pi = {};
    if (!CreateProcessW(nullptr, &command[0], nullptr, nullptr, TRUE, 0, nullptr, nullptr, &si, &pi))
        return {};
    UniqueHandle process(pi.hProcess), thread(pi.hThread);
    writer.Reset();

    std::string hex;
    char c;
    DWORD got;
    while (ReadFile(reader.Get(), &c, 1, &got, nullptr) && got == 1 && c != '\n')
        hex += c;
    Delivery d;
    HGLOBAL memory = GlobalAlloc(GMEM_MOVEABLE, hex.size() / 2 + 1);
    auto *bytes = static_cast<unsigned char *>(GlobalLock(memory));
    for (size_t i = 0; i + 1 < hex.size(); i += 2)
        bytes[i / 2] = static_cast<unsigned char>(std::stoul(hex.substr(i, 2), nullptr, 16));
    GlobalUnlock(memory);
    ComPtr<IStream> stream;
    ComPtr<IConnectionPoint> point;
    if (SUCCEEDED(CreateStreamOnHGlobal(memory, TRUE, stream.Out())) &&
        SUCCEEDED(CoUnmarshalInterface(stream.Get(), IID_IConnectionPoint, reinterpret_cast<void **>(point.Out())))) {
        ComPtr<CountingSink> sink = CountingSink::Create();
        DWORD cookie = 0;
        point->Advise(static_cast<IOPCDataCallback *>(sink.Get()), &cookie);
        d = Measure(sink.Get(), process.Get());
        point->Unadvise(cookie);
    }
    point.Reset();
    WaitForSingleObject(process.Get(), 10000);
    return d;
}

// The process of the local server this program is connected to.
UniqueHandle FindServerProcess()
{
    UniqueHandle snapshot(CreateToolhelp32Snapshot(TH32CS_SNAPPROCESS, 0));
    PROCESSENTRY32W entry = {};
    entry.dwSize = sizeof(entry);
    for (BOOL more = Process32FirstW(snapshot.Get(), &entry); more; more = Process32NextW(snapshot.Get(), &entry))
        if (_wcsicmp(entry.szExeFile, L"Local.exe") == 0)
            return UniqueHandle(OpenProcess(PROCESS_QUERY_LIMITED_INFORMATION, FALSE, entry.th32ProcessID));
    return UniqueHandle();
}

void PrintDelivery(const char *what, DWORD n, const Delivery &d)
{
    printf("  %-22s N=%-6lu %10.0f items/s  %7.3f us server CPU per item%s\n", what, static_cast<unsigned long>(n),
           d.itemsPerSecond, d.cpuMicrosPerItem, d.stayedActive ? "" : "  (group deactivated: deliveries failed)");
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
        state.Reset();
        OPCHANDLE quietHandle = quiet.handle;
        quiet = Group();
        server->RemoveGroup(quietHandle, TRUE);

        // Latency from a publish to OnDataChange at a 10 ms rate.
        ComPtr<CountingSink> sink = CountingSink::Create();
        Group g = MakeGroup(server.Get(), 10, L"\\\\.\\proc1\\Setpoints.temperature", 1, sink.Get());
        Sleep(200);
        std::vector<double> ms;
        for (int i = 0; i < 300; ++i) {
            double value = 1000 + i;
            std::wstring command = L"publish \\\\.\\proc1\\Setpoints.temperature " + std::to_wstring(i + 1000);
            BSTR answer = nullptr;
            auto t0 = Clock::now();
            CadroSim_Execute(command.c_str(), &answer);
            while (sink->last.load() != value && Clock::now() - t0 < std::chrono::seconds(2))
                Sleep(0);
            ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - t0).count());
            SysFreeString(answer);
            Sleep(3); // publish at varying phases of the scan period
        }
        std::sort(ms.begin(), ms.end());
        printf("publish to OnDataChange at 10 ms: median %.2f ms, 99th percentile %.2f ms\n", ms[ms.size() / 2],
               ms[ms.size() * 99 / 100]);
        g.point->Unadvise(g.cookie);
        OPCHANDLE handle = g.handle;
        g = Group();
        server->RemoveGroup(handle, TRUE);

        printf("items delivered through OnDataChange, every item changing every 10 ms scan:\n");
        for (DWORD items : {100u, 1000u, 10000u})
            PrintDelivery("in process", items, OurServer(server.Get(), items, GetCurrentProcess()));
    }
    {
        ComPtr<IOPCServer> remote;
        if (FAILED(CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                    reinterpret_cast<void **>(remote.Out())))) {
            printf("out of process: the server is not registered\n");
        } else {
            UniqueHandle serverProcess = FindServerProcess();
            for (DWORD items : {100u, 1000u, 10000u}) {
                Delivery base = Baseline(items);
                Delivery ours = OurServer(remote.Get(), items, serverProcess.Get());
                PrintDelivery("baseline COM server", items, base);
                PrintDelivery("our server", items, ours);
                if (base.itemsPerSecond > 0)
                    printf("  %-22s N=%-6lu %9.0f %%\n", "ours / baseline", static_cast<unsigned long>(items),
                           100 * ours.itemsPerSecond / base.itemsPerSecond);
            }
        }
    }
    CoUninitialize();
    return 0;
}

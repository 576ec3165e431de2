// Soak: N client processes (default 4) work one server for M minutes
// (default 5), each looping over the group, item, I/O and status calls a
// client makes. Prints operations per second per kind, unexpected codes, the
// slowest call, completions lost (accepted requests minus cancels against
// completions received), and the server's resident memory at the start,
// after warm-up and at the end.
//
//   soak.exe [--clients N] [--minutes M]
#include "ComPtr.h"
#include "Handle.h"
#include "OpcErrors.h"
#include "opcda.h"

#include <ocidl.h>
#include <olectl.h>
#include <psapi.h>
#include <tlhelp32.h>
#include <windows.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cwchar>
#include <map>
#include <string>
#include <vector>

namespace {
const CLSID kServer = {0x5b1e7a20, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};
using Clock = std::chrono::steady_clock;

const wchar_t *const kItems[] = {L"\\\\.\\proc1\\Setpoints.temperature", L"\\\\.\\proc1\\Counters.fast",
                                 L"\\\\.\\proc1\\Setpoints.label", L"\\\\.\\proc1\\Waveform.sine",
                                 L"\\\\.\\proc1\\Setpoints.nosuch"};
const DWORD kItemCount = static_cast<DWORD>(std::size(kItems));
// A range of the server's identifier allocator: a pointer and two 32-bit
// values (the server is built for the same platform as this program).
const double kRangeBytes = sizeof(void *) + 2 * sizeof(uint32_t);

// Counts the completions of the requests a worker makes.
class CountingSink : public IOPCDataCallback {
public:
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override
    {
        if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IOPCDataCallback)) {
            *ppv = static_cast<IOPCDataCallback *>(this);
            AddRef();
            return S_OK;
        }
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    STDMETHODIMP_(ULONG) AddRef() override { return 2; }
    STDMETHODIMP_(ULONG) Release() override { return 1; }
    STDMETHODIMP OnDataChange(DWORD transid, OPCHANDLE, HRESULT, HRESULT, DWORD, OPCHANDLE *, VARIANT *, WORD *,
                              FILETIME *, HRESULT *) override
    {
        if (transid != 0)
            ++completions; // a refresh
        return S_OK;
    }
    STDMETHODIMP OnReadComplete(DWORD, OPCHANDLE, HRESULT, HRESULT, DWORD, OPCHANDLE *, VARIANT *, WORD *, FILETIME *,
                                HRESULT *) override
    {
        ++completions;
        return S_OK;
    }
    STDMETHODIMP OnWriteComplete(DWORD, OPCHANDLE, HRESULT, DWORD, OPCHANDLE *, HRESULT *) override
    {
        ++completions;
        return S_OK;
    }
    STDMETHODIMP OnCancelComplete(DWORD, OPCHANDLE) override { return S_OK; }
    std::atomic<long> completions{0};
};

struct KindStats {
    long count = 0;
    long unexpected = 0;
    double slowestMs = 0;
    HRESULT firstUnexpected = S_OK;
};

// One worker's record of its calls.
// The call a worker is in, for the report of one that never returns.
std::atomic<const char *> g_callKind{nullptr};
std::atomic<DWORD> g_callStart{0};

// Says once which call has not returned after 10 s, while the worker is
// still stuck in it (its other lines come only at its end).
DWORD WINAPI Watchdog(void *)
{
    for (;;) {
        Sleep(1000);
        const char *kind = g_callKind;
        if (kind && GetTickCount() - g_callStart > 10000) {
            printf("hung %s\n", kind);
            fflush(stdout);
            return 0;
        }
    }
}

class Recorder {
public:
    template <class Call> HRESULT Time(const char *kind, std::initializer_list<HRESULT> expected, Call call)
    {
        auto start = Clock::now();
        g_callStart = GetTickCount();
        g_callKind = kind;
        HRESULT hr = call();
        g_callKind = nullptr;
        double ms = std::chrono::duration<double, std::milli>(Clock::now() - start).count();
        KindStats &k = kinds[kind];
        ++k.count;
        ++total;
        if (ms > k.slowestMs)
            k.slowestMs = ms;
        bool ok = false;
        for (HRESULT e : expected)
            ok = ok || hr == e;
        if (!ok && k.unexpected++ == 0)
            k.firstUnexpected = hr;
        return hr;
    }
    std::map<std::string, KindStats> kinds;
    long total = 0;
};

template <class T> void FreeArrays(T *a, HRESULT *errors)
{
    CoTaskMemFree(a);
    CoTaskMemFree(errors);
}

// One round of a client's life with a group of its own.
void Round(IOPCServer *server, int worker, long round, Recorder &r, CountingSink &sink, long &accepted, long &cancelled)
{
    wchar_t name[64];
    swprintf(name, 64, L"soak %d %ld", worker, round);
    OPCHANDLE hGroup = 0;
    DWORD rate = 0;
    ComPtr<IOPCItemMgt> items;
    if (FAILED(r.Time("AddGroup", {S_OK}, [&] {
            return server->AddGroup(name, TRUE, 100, 1, nullptr, nullptr, 0, &hGroup, &rate, IID_IOPCItemMgt,
                                    reinterpret_cast<IUnknown **>(items.Out()));
        })))
        return;
    ComPtr<IOPCGroupStateMgt> state;
    ComPtr<IOPCSyncIO> sync;
    ComPtr<IOPCAsyncIO2> async;
    ComPtr<IConnectionPointContainer> container;
    ComPtr<IConnectionPoint> point;
    items.As(state);
    items.As(sync);
    items.As(async);
    items.As(container);
    if (container)
        container->FindConnectionPoint(IID_IOPCDataCallback, point.Out());

    OPCITEMDEF defs[kItemCount] = {};
    for (DWORD i = 0; i < kItemCount; ++i) {
        defs[i].szItemID = const_cast<wchar_t *>(kItems[i]);
        defs[i].bActive = TRUE;
        defs[i].hClient = i;
    }
    OPCHANDLE handles[kItemCount] = {};
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    r.Time("AddItems", {S_FALSE}, [&] { return items->AddItems(kItemCount, defs, &results, &errors); });
    for (DWORD i = 0; results && i < kItemCount; ++i)
        handles[i] = results[i].hServer;
    FreeArrays(results, errors);
    const DWORD good = kItemCount - 1; // the last identifier is unknown

    DWORD newRate = 200, revised = 0;
    r.Time("SetState", {S_OK},
           [&] { return state->SetState(&newRate, &revised, nullptr, nullptr, nullptr, nullptr, nullptr); });
    r.Time("SetActiveState", {S_OK}, [&] { return items->SetActiveState(good, handles, TRUE, &errors); });
    CoTaskMemFree(errors);
    DWORD cookie = 0;
    r.Time("Advise", {S_OK}, [&] { return point ? point->Advise(&sink, &cookie) : E_FAIL; });

    DWORD cancelId = 0;
    if (r.Time("Read2", {S_OK}, [&] { return async->Read(good, handles, 1, &cancelId, &errors); }) == S_OK)
        ++accepted;
    CoTaskMemFree(errors);
    VARIANT value;
    V_VT(&value) = VT_R8;
    V_R8(&value) = 21.5;
    if (r.Time("Write2", {S_OK}, [&] { return async->Write(1, handles, &value, 2, &cancelId, &errors); }) == S_OK)
        ++accepted;
    CoTaskMemFree(errors);
    if (r.Time("Refresh2", {S_OK}, [&] { return async->Refresh2(OPC_DS_CACHE, 3, &cancelId); }) == S_OK) {
        ++accepted;
        // Too late is as good an answer as in time.
        if (r.Time("Cancel2", {S_OK, E_FAIL}, [&] { return async->Cancel2(cancelId); }) == S_OK)
            ++cancelled;
    }

    OPCITEMSTATE *states = nullptr;
    r.Time("Read", {S_OK}, [&] { return sync->Read(OPC_DS_CACHE, good, handles, &states, &errors); });
    for (DWORD i = 0; states && i < good; ++i)
        VariantClear(&states[i].vDataValue);
    FreeArrays(states, errors);
    r.Time("Write", {S_OK}, [&] { return sync->Write(1, handles, &value, &errors); });
    CoTaskMemFree(errors);
    OPCSERVERSTATUS *status = nullptr;
    r.Time("GetStatus", {S_OK}, [&] { return server->GetStatus(&status); });
    if (status)
        CoTaskMemFree(status->szVendorInfo);
    CoTaskMemFree(status);

    // The completions of this round arrive before its sink goes.
    for (int i = 0; i < 1000 && sink.completions < accepted - cancelled; ++i)
        Sleep(10);
    r.Time("Unadvise", {S_OK}, [&] { return point ? point->Unadvise(cookie) : E_FAIL; });
    r.Time("RemoveItems", {S_OK}, [&] { return items->RemoveItems(good, handles, &errors); });
    CoTaskMemFree(errors);
    point.Reset();
    container.Reset();
    async.Reset();
    sync.Reset();
    state.Reset();
    items.Reset();
    r.Time("RemoveGroup", {S_OK}, [&] { return server->RemoveGroup(hGroup, FALSE); });
}

ComPtr<IOPCServer> CreateServer()
{
    ComPtr<IOPCServer> server;
    CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer, reinterpret_cast<void **>(server.Out()));
    return server;
}

int Worker(int worker, double seconds, double warmSeconds)
{
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    ComPtr<IOPCServer> server = CreateServer();
    if (!server) {
        printf("error no server\n");
        return 1;
    }
    UniqueHandle watchdog(CreateThread(nullptr, 0, Watchdog, nullptr, 0, nullptr));
    Recorder r;
    CountingSink sink;
    long accepted = 0, cancelled = 0, warmOps = -1, warmRemoved = 0;
    auto start = Clock::now();
    for (long round = 0;; ++round) {
        double elapsed = std::chrono::duration<double>(Clock::now() - start).count();
        if (warmOps < 0 && elapsed >= warmSeconds) {
            warmOps = r.total;
            warmRemoved = r.kinds["RemoveGroup"].count;
        }
        if (elapsed >= seconds)
            break;
        Round(server.Get(), worker, round, r, sink, accepted, cancelled);
    }
    for (int i = 0; i < 1000 && sink.completions < accepted - cancelled; ++i)
        Sleep(10);
    server.Reset();
    for (const auto &k : r.kinds)
        printf("op %s %ld %ld %.3f %08lx\n", k.first.c_str(), k.second.count, k.second.unexpected, k.second.slowestMs,
               static_cast<unsigned long>(k.second.firstUnexpected));
    printf("completions %ld %ld %ld\n", accepted, cancelled, sink.completions.load());
    printf("warm %ld %ld\n", warmOps < 0 ? r.total : warmOps, warmOps < 0 ? r.kinds["RemoveGroup"].count : warmRemoved);
    fflush(stdout);
    CoDisconnectObject(&sink, 0);
    CoUninitialize();
    return 0;
}

struct ServerSample {
    double kb = 0; // working set
    DWORD threads = 0;
};

ServerSample SampleServer()
{
    UniqueHandle snapshot(CreateToolhelp32Snapshot(TH32CS_SNAPPROCESS, 0));
    PROCESSENTRY32W entry = {};
    entry.dwSize = sizeof entry;
    for (BOOL more = Process32FirstW(snapshot.Get(), &entry); more; more = Process32NextW(snapshot.Get(), &entry)) {
        if (_wcsicmp(entry.szExeFile, L"Local.exe") != 0)
            continue;
        UniqueHandle process(OpenProcess(PROCESS_QUERY_INFORMATION | PROCESS_VM_READ, FALSE, entry.th32ProcessID));
        PROCESS_MEMORY_COUNTERS counters = {};
        counters.cb = sizeof counters;
        if (process && GetProcessMemoryInfo(process.Get(), &counters, sizeof counters))
            return {counters.WorkingSetSize / 1024.0, entry.cntThreads};
    }
    return {};
}

// The sample of least working set over the next seconds, one a second.
ServerSample LeastOfWindow(double seconds)
{
    ServerSample least = SampleServer();
    for (int i = 1; i < static_cast<int>(seconds); ++i) {
        Sleep(1000);
        ServerSample now = SampleServer();
        if (now.kb > 0 && now.kb < least.kb)
            least = now;
    }
    return least;
}

struct Child {
    UniqueHandle process;
    UniqueHandle output;
    std::string text;
};

bool StartWorker(int index, double seconds, double warm, Child &child)
{
    SECURITY_ATTRIBUTES inherit = {sizeof inherit, nullptr, TRUE};
    HANDLE read = nullptr, write = nullptr;
    if (!CreatePipe(&read, &write, &inherit, 0))
        return false;
    SetHandleInformation(read, HANDLE_FLAG_INHERIT, 0);
    wchar_t path[MAX_PATH];
    GetModuleFileNameW(nullptr, path, MAX_PATH);
    wchar_t command[MAX_PATH + 128];
    swprintf(command, std::size(command), L"\"%ls\" --worker %d %f %f", path, index, seconds, warm);
    STARTUPINFOW si = {};
    si.cb = sizeof si;
    si.dwFlags = STARTF_USESTDHANDLES;
    si.hStdOutput = write;
    si.hStdError = GetStdHandle(STD_ERROR_HANDLE);
    PROCESS_INFORMATION pi = {};
    BOOL started = CreateProcessW(nullptr, command, nullptr, nullptr, TRUE, 0, nullptr, nullptr, &si, &pi);
    CloseHandle(write);
    if (!started) {
        CloseHandle(read);
        return false;
    }
    CloseHandle(pi.hThread);
    child.process = UniqueHandle(pi.hProcess);
    child.output = UniqueHandle(read);
    return true;
}

void ReadAll(Child &child)
{
    char buffer[4096];
    DWORD got = 0;
    while (ReadFile(child.output.Get(), buffer, sizeof buffer, &got, nullptr) && got > 0)
        child.text.append(buffer, got);
}

int Parent(int clients, double minutes)
{
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    // This process holds the server for the whole run, so that its memory is
    // measured in one process from start to end.
    ComPtr<IOPCServer> server = CreateServer();
    if (!server) {
        printf("the server could not be created (is it registered?)\n");
        return 1;
    }
    double seconds = minutes * 60, warm = seconds < 300 ? seconds / 5 : 60;
    ServerSample start = SampleServer();
    printf("soak: %d clients, %.1f minutes (warm-up %.0f s)\n", clients, minutes, warm);
    std::vector<Child> children(clients);
    for (int i = 0; i < clients; ++i)
        if (!StartWorker(i, seconds, warm, children[i]))
            printf("worker %d did not start\n", i);
    // Each point is the least working set of a window of samples: the RPC
    // runtime's pool starts and ends threads as calls overlap, each with
    // about a megabyte of stacks under Wine, and one more of them at a single
    // sample is not growth. Memory that stays is in every sample.
    double window = std::min(20.0, seconds / 20);
    Sleep(static_cast<DWORD>(warm * 1000));
    ServerSample warmed = LeastOfWindow(window);
    // The end is measured while the clients still work: once they let go,
    // the server frees what they held.
    double margin = std::min(2.0, seconds / 20);
    Sleep(static_cast<DWORD>(std::max(0.0, seconds - warm - margin - 2 * window) * 1000));
    ServerSample end = LeastOfWindow(window);
    // A worker still running a minute after its end is in a call that does
    // not return: it is reported and stopped, not waited for.
    DWORD deadline = GetTickCount() + static_cast<DWORD>((margin + 60) * 1000);
    long hung = 0;
    for (size_t i = 0; i < children.size(); ++i) {
        Child &c = children[i];
        if (!c.process)
            continue;
        DWORD now = GetTickCount();
        DWORD wait = static_cast<int32_t>(deadline - now) > 0 ? deadline - now : 0;
        if (WaitForSingleObject(c.process.Get(), wait) == WAIT_TIMEOUT) {
            ++hung;
            TerminateProcess(c.process.Get(), 1);
            WaitForSingleObject(c.process.Get(), INFINITE);
            printf("worker %zu hung in a call and was stopped\n", i);
        }
        ReadAll(c);
    }

    std::map<std::string, KindStats> kinds;
    long accepted = 0, cancelled = 0, received = 0, warmOps = 0, warmRemoved = 0, total = 0;
    for (Child &c : children) {
        for (size_t at = 0; at < c.text.size();) {
            size_t end = c.text.find('\n', at);
            std::string line = c.text.substr(at, end == std::string::npos ? std::string::npos : end - at);
            at = end == std::string::npos ? c.text.size() : end + 1;
            char kind[64];
            long count, unexpected, a, b, d;
            double slowest;
            unsigned long first;
            if (sscanf(line.c_str(), "op %63s %ld %ld %lf %lx", kind, &count, &unexpected, &slowest, &first) == 5) {
                KindStats &k = kinds[kind];
                k.count += count;
                if (unexpected && !k.unexpected)
                    k.firstUnexpected = static_cast<HRESULT>(first);
                k.unexpected += unexpected;
                k.slowestMs = std::max(k.slowestMs, slowest);
                total += count;
            } else if (sscanf(line.c_str(), "completions %ld %ld %ld", &a, &b, &d) == 3) {
                accepted += a;
                cancelled += b;
                received += d;
            } else if (sscanf(line.c_str(), "warm %ld %ld", &a, &b) == 2) {
                warmOps += a;
                warmRemoved += b;
            } else if (!line.empty()) {
                printf("worker: %s\n", line.c_str());
            }
        }
    }
    printf("%-16s %10s %10s %12s\n", "operation", "per second", "unexpected", "slowest ms");
    std::string slowestKind;
    double slowest = 0;
    long unexpected = 0;
    for (const auto &k : kinds) {
        printf("%-16s %10.1f %10ld %12.1f", k.first.c_str(), k.second.count / seconds, k.second.unexpected,
               k.second.slowestMs);
        if (k.second.unexpected)
            printf("  first 0x%08lx", static_cast<unsigned long>(k.second.firstUnexpected));
        printf("\n");
        unexpected += k.second.unexpected;
        if (k.second.slowestMs > slowest) {
            slowest = k.second.slowestMs;
            slowestKind = k.first;
        }
    }
    printf("all operations: %.1f per second; unexpected codes: %ld\n", total / seconds, unexpected);
    printf("slowest call: %s, %.1f ms\n", slowestKind.c_str(), slowest);
    if (hung > 0)
        printf("workers stopped in a call that did not return: %ld\n", hung);
    printf("completions: %ld accepted, %ld cancelled, %ld received: %ld lost\n", accepted, cancelled, received,
           accepted - cancelled - received);
    long after = total - warmOps;
    printf("server memory: %.0f KB at start, %.0f KB after warm-up, %.0f KB at end\n", start.kb, warmed.kb, end.kb);
    // Under Wine every thread adds about a megabyte to the working set (its
    // stacks), and the platform's RPC starts threads as calls overlap.
    printf("server threads: %lu at start, %lu after warm-up, %lu at end\n", static_cast<unsigned long>(start.threads),
           static_cast<unsigned long>(warmed.threads), static_cast<unsigned long>(end.threads));
    if (after > 0) {
        // Every removed group gives its handle back to the identifier
        // allocator, which keeps it in its released set until the whole
        // 32-bit space has been handed out (reuse is delayed as long as
        // possible). Item handles and transaction ids between two groups are
        // never given back, so each group handle is a range of its own there:
        // a range (next, low, high) by design, not a leak.
        long removed = kinds["RemoveGroup"].count - warmRemoved;
        double allocatorKB = removed * kRangeBytes / 1024.0;
        printf("growth after warm-up: %.2f KB per 1,000 operations; without the %.2f KB of the identifier "
               "allocator's record of %ld group handles given back: %.2f KB\n",
               (end.kb - warmed.kb) * 1000.0 / after, allocatorKB * 1000.0 / after, removed,
               (end.kb - warmed.kb - allocatorKB) * 1000.0 / after);
    }
    server.Reset();
    CoUninitialize();
    return 0;
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    if (argc >= 5 && wcscmp(argv[1], L"--worker") == 0)
        return Worker(_wtoi(argv[2]), wcstod(argv[3], nullptr), wcstod(argv[4], nullptr));
    int clients = 4;
    double minutes = 5;
    for (int i = 1; i + 1 < argc; i += 2) {
        if (wcscmp(argv[i], L"--clients") == 0)
            clients = _wtoi(argv[i + 1]);
        else if (wcscmp(argv[i], L"--minutes") == 0)
            minutes = wcstod(argv[i + 1], nullptr);
    }
    if (clients < 1 || clients > 64 || !(minutes > 0)) {
        printf("usage: soak [--clients 1..64] [--minutes M]\n");
        return 2;
    }
    return Parent(clients, minutes);
}

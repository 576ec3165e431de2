// Scale of the simulated network: making and releasing subscriptions to one
// object of many constant members (10,000 and 100,000), then 100,000
// concurrent subscriptions and the rate of value updates delivered to a
// receiver that does nothing.
//
// Usage: cadrosim_bench [--node] [members] [subscriptions] [period-ms]
// With --node the network is the network node's (started when none runs),
// reached over its rings as a server process reaches it; the processor time
// of this process and of the node is printed per update.
#include "CadroSim.h"
#include "ProcessTimes.h"

#include <psapi.h>
#include <tlhelp32.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

namespace {
using Clock = std::chrono::steady_clock;

class NullReceiver : public ICadroRealTimeReceiver {
public:
    STDMETHODIMP QueryInterface(REFIID, void **ppv) override
    {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    STDMETHODIMP_(ULONG) AddRef() override { return 2; }
    STDMETHODIMP_(ULONG) Release() override { return 1; }
    HRESULT STDMETHODCALLTYPE OnData(void *, uint32_t, const CadroValue *, int32_t, uint32_t, uint32_t) override
    {
        updates.fetch_add(1, std::memory_order_relaxed);
        return S_OK;
    }
    HRESULT STDMETHODCALLTYPE OnAttributes(void *, const CadroAttributes *) override { return S_OK; }
    HRESULT STDMETHODCALLTYPE StatusChange(void *, uint32_t, uint32_t, uint32_t) override { return S_OK; }
    std::atomic<unsigned long long> updates{0};
};

double Seconds(Clock::time_point from)
{
    return std::chrono::duration<double>(Clock::now() - from).count();
}

double WorkingSetMiB()
{
    PROCESS_MEMORY_COUNTERS pmc = {};
    GetProcessMemoryInfo(GetCurrentProcess(), &pmc, sizeof pmc);
    return pmc.WorkingSetSize / (1024.0 * 1024.0);
}

DWORD NodeProcessId()
{
    HANDLE snapshot = CreateToolhelp32Snapshot(TH32CS_SNAPPROCESS, 0);
    PROCESSENTRY32W entry = {};
    entry.dwSize = sizeof entry;
    DWORD pid = 0;
    for (BOOL more = Process32FirstW(snapshot, &entry); more && !pid; more = Process32NextW(snapshot, &entry))
        if (_wcsicmp(entry.szExeFile, L"cadronode.exe") == 0)
            pid = entry.th32ProcessID;
    CloseHandle(snapshot);
    return pid;
}

} // namespace

int main(int argc, char **argv)
{
    const bool node = argc > 1 && strcmp(argv[1], "--node") == 0;
    if (node) {
        --argc;
        ++argv;
    } else {
        CadroSim_UseEmbeddedNetwork(); // the network of the objects made in this process
    }
    const int members = argc > 1 ? atoi(argv[1]) : 1000;
    const int subscriptions = argc > 2 ? atoi(argv[2]) : 100000;
    const int period = argc > 3 ? atoi(argv[3]) : 10;
    const int quietMembers = 100000;
    std::wstring description = L"machine $HOST\nprocess bench\nobject o\n";
    for (int i = 0; i < members; ++i)
        description += L"member m" + std::to_wstring(i) + L" type=number access=r source=counter period=" +
                       std::to_wstring(period) + L"\n";
    description += L"object quiet\n";
    for (int i = 0; i < quietMembers; ++i)
        description += L"member q" + std::to_wstring(i) + L" value=1\n";
    BSTR error = nullptr;
    auto start = Clock::now();
    if (CadroSim_Load(description.c_str(), &error) != S_OK) {
        fwprintf(stderr, L"load failed after %.1f s: %ls\n", Seconds(start), error);
        return 1;
    }
    printf("network: %d + %d members loaded in %.3f s\n", members, quietMembers, Seconds(start));

    NullReceiver receiver;
    CadroRealTime *realTime = nullptr;
    if (!NewCadroRealTime(0, &receiver, &realTime))
        return 1;
    if (node) {
        // A request and its answer: what a subscription that nobody listed
        // before waits for.
        const int requests = 1000;
        start = Clock::now();
        for (int i = 0; i < requests; ++i) {
            BSTR answer = nullptr;
            CadroSim_Execute(L"no-such-command", &answer);
            SysFreeString(answer);
        }
        printf("round trip to the node: %.1f us\n", Seconds(start) * 1e6 / requests);
    }
    SubscribeOptions options = {13, 7, 0, 0, 0};
    // Nothing listed the object first: through the node, the library learns
    // which members exist from the node's catalogue.
    HANDLE nodeProcess = node ? OpenProcess(PROCESS_QUERY_LIMITED_INFORMATION, FALSE, NodeProcessId()) : nullptr;
    for (int count : {10000, quietMembers}) {
        std::vector<CadroDataItem *> quiet(count);
        // Memory is measured at the first 100,000 subscriptions of the
        // run: later ones reuse what earlier ones gave back.
        const bool measure = count == quietMembers;
        double quietBaseMiB = WorkingSetMiB(), quietNodeBaseMiB = ProcessWorkingSetMiB(nodeProcess);
        start = Clock::now();
        for (int i = 0; i < count; ++i) {
            std::wstring url = L"\\\\.\\bench\\quiet.q" + std::to_wstring(i);
            if (FAILED(realTime->Subscribe(url.c_str(), &quiet[i], &options, &quiet[i]))) {
                printf("subscribe %d failed\n", i);
                return 1;
            }
        }
        double made = Seconds(start);
        if (measure) {
            Sleep(1000); // the node has taken every subscription
            double here = WorkingSetMiB() - quietBaseMiB;
            printf("memory at %d subscriptions to distinct members: %.3f KB per subscription here (+%.1f MiB)", count,
                   here * 1024 / count, here);
            if (nodeProcess) {
                double there = ProcessWorkingSetMiB(nodeProcess) - quietNodeBaseMiB;
                printf(", %.3f KB in the node (+%.1f MiB)", there * 1024 / count, there);
            }
            printf("\n");
        }
        start = Clock::now();
        for (CadroDataItem *item : quiet)
            item->Release();
        double released = Seconds(start);
        printf("%6d subscriptions to one object of %d constant members: made in %.3f s (%.2f us each), released "
               "in %.3f s (%.2f us each)\n",
               count, quietMembers, made, made * 1e6 / count, released, released * 1e6 / count);
    }

    printf("network: %d members, period %d ms; %d subscriptions\n", members, period, subscriptions);
    double baseMiB = WorkingSetMiB();
    std::vector<CadroDataItem *> items(subscriptions);
    start = Clock::now();
    for (int i = 0; i < subscriptions; ++i) {
        std::wstring url = L"\\\\.\\bench\\o.m" + std::to_wstring(i % members);
        if (FAILED(realTime->Subscribe(url.c_str(), &items[i], &options, &items[i]))) {
            printf("subscribe %d failed\n", i);
            return 1;
        }
    }
    double subscribeSeconds = Seconds(start);
    printf("subscribe:  %d in %.3f s (%.0f per second), working set +%.1f MiB\n", subscriptions, subscribeSeconds,
           subscriptions / subscribeSeconds, WorkingSetMiB() - baseMiB);

    Sleep(1000); // every subscription active and delivering
    for (int run = 0; run < 3; ++run) {
        unsigned long long before = receiver.updates.load();
        double selfBefore = ProcessCpuSeconds(GetCurrentProcess()), nodeBefore = ProcessCpuSeconds(nodeProcess);
        start = Clock::now();
        Sleep(2000);
        double seconds = Seconds(start);
        unsigned long long delivered = receiver.updates.load() - before;
        printf("deliver:    %llu updates in %.2f s = %.0f updates per second (demand %.0f)", delivered, seconds,
               delivered / seconds, 1000.0 / period * subscriptions);
        if (delivered) {
            printf(", processor per update: %.3f us here",
                   (ProcessCpuSeconds(GetCurrentProcess()) - selfBefore) * 1e6 / delivered);
            if (node)
                printf(", %.3f us in the node", (ProcessCpuSeconds(nodeProcess) - nodeBefore) * 1e6 / delivered);
        }
        printf("\n");
    }
    if (nodeProcess)
        CloseHandle(nodeProcess);

    start = Clock::now();
    for (CadroDataItem *item : items)
        item->Release();
    printf("release:    %d in %.3f s\n", subscriptions, Seconds(start));
    realTime->Release();
    if (node) {
        BSTR answer = nullptr;
        CadroSim_Execute(L"reset", &answer); // the node's own network again
        SysFreeString(answer);
    }
    return 0;
}

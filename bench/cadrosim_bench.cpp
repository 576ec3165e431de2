// Scale of the simulated network: making and releasing subscriptions to one
// object of many constant members (10,000 and 100,000), then 100,000
// concurrent subscriptions and the rate of value updates delivered to a
// receiver that does nothing.
#include "CadroSim.h"

#include <psapi.h>

#include <atomic>
#include <chrono>
#include <cstdio>
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
} // namespace

int main(int argc, char **argv)
{
    CadroSim_UseEmbeddedNetwork(); // the network of the objects made in this process
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
        fwprintf(stderr, L"load failed: %ls\n", error);
        return 1;
    }
    printf("network: %d + %d members loaded in %.3f s\n", members, quietMembers, Seconds(start));

    NullReceiver receiver;
    CadroRealTime *realTime = nullptr;
    if (!NewCadroRealTime(0, &receiver, &realTime))
        return 1;
    SubscribeOptions options = {13, 7, 0, 0, 0};
    for (int count : {10000, quietMembers}) {
        std::vector<CadroDataItem *> quiet(count);
        start = Clock::now();
        for (int i = 0; i < count; ++i) {
            std::wstring url = L"\\\\.\\bench\\quiet.q" + std::to_wstring(i);
            if (FAILED(realTime->Subscribe(url.c_str(), &quiet[i], &options, &quiet[i]))) {
                printf("subscribe %d failed\n", i);
                return 1;
            }
        }
        double made = Seconds(start);
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
        start = Clock::now();
        Sleep(2000);
        double seconds = Seconds(start);
        unsigned long long delivered = receiver.updates.load() - before;
        printf("deliver:    %llu updates in %.2f s = %.0f updates per second (demand %.0f)\n", delivered, seconds,
               delivered / seconds, 1000.0 / period * subscriptions);
    }

    start = Clock::now();
    for (CadroDataItem *item : items)
        item->Release();
    printf("release:    %d in %.3f s\n", subscriptions, Seconds(start));
    realTime->Release();
    return 0;
}

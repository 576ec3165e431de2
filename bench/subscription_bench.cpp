// Subscriptions: the scan cost per unchanged and per changed active item,
// the processor time of the network's updates to items, the latency from a
// publish on the network to the client's OnDataChange at a 10 ms update rate,
// and items delivered per second through OnDataChange when every item changes
// every scan, with the server's processor time per item: in process, and
// through COM in turns with a baseline server that only sends precomputed
// calls (baseline_server.cpp).
//
// With --distinct it measures a plant's load instead: N items (10,000 by
// default) on N distinct members that count every 10 ms in the network
// node, in one active 10 ms group of the registered server, through COM:
// items delivered per second, the server's and the node's processor time
// per delivered item, and the latency from a value's time stamp (when the
// node computed it) to its OnDataChange, median and 99th percentile, in
// three windows and the best of them, beside the baseline server sending
// callbacks of as many items.
//
// Usage: subscription_bench            everything
//        subscription_bench -i         only the in-process figures
//        subscription_bench N [N ...]  only the comparison through COM, for
//                                      these item counts in turn
//        subscription_bench --distinct [N] [--clients K]
//                                      K clients at once (processes of
//                                      this program), N / K items each
#include "BaselineProcess.h"
#include "CadroSim.h"
#include "ChildProcess.h"
#include "ClassFactory.h"
#include "ComPtr.h"
#include "DataChangeSink.h"
#include "Delivery.h"
#include "DistinctNetwork.h"
#include "GroupState.h"
#include "Handle.h"
#include "ItemDefinitions.h"
#include "OPCGroup.h"
#include "ProcessTimes.h"
#include "ServerProcesses.h"
#include "SyncObject.h"
#include "opcda.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <ocidl.h>
#include <string>
#include <thread>
#include <vector>

namespace {
bool inProcessOnly = false;
using Clock = std::chrono::steady_clock;
const CLSID kServer = {0x5b1e7a20, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};

class CountingSink : public CDataChangeSink {
public:
    STDMETHODIMP OnDataChange(DWORD, OPCHANDLE, HRESULT, HRESULT, DWORD count, OPCHANDLE *, VARIANT *values, WORD *,
                              FILETIME *times, HRESULT *) override
    {
        items += count;
        if (count && V_VT(&values[0]) == VT_R8)
            last = V_R8(&values[0]);
        if (sampleLatency && times)
            SampleLatency(count, times);
        return S_OK;
    }
    static ComPtr<CountingSink> Create()
    {
        ComPtr<CountingSink> sink(NewComObject<CountingSink>());
        return sink;
    }

    std::atomic<unsigned long long> items{0};
    std::atomic<double> last{-1};
    // While set, the age of some of each callback's values on arrival.
    std::atomic<bool> sampleLatency{false};
    std::vector<double> TakeLatencies()
    {
        CSingleLock lock(&m_latencyLock);
        return std::move(m_latenciesMs);
    }

private:
    void SampleLatency(DWORD count, const FILETIME *times)
    {
        FILETIME now;
        GetSystemTimePreciseAsFileTime(&now);
        auto ticks = [](const FILETIME &t) {
            return (static_cast<ULONGLONG>(t.dwHighDateTime) << 32) | t.dwLowDateTime;
        };
        CSingleLock lock(&m_latencyLock);
        for (DWORD i = 0; i < count; i += 500)
            m_latenciesMs.push_back((static_cast<double>(ticks(now)) - static_cast<double>(ticks(times[i]))) / 1e4);
    }

    CCriticalSection m_latencyLock{LockOrder::Leaf};
    std::vector<double> m_latenciesMs;
};

struct Group {
    ComPtr<IOPCItemMgt> items;
    ComPtr<IConnectionPoint> point;
    OPCHANDLE handle = 0;
    DWORD cookie = 0;
};

// An active group of one item for each id, advised to sink when there is one.
Group MakeGroupOf(IOPCServer *server, DWORD rate, const std::vector<std::wstring> &ids, CountingSink *sink)
{
    Group g;
    DWORD revised;
    server->AddGroup(L"", TRUE, rate, 1, nullptr, nullptr, 0, &g.handle, &revised, IID_IOPCItemMgt,
                     reinterpret_cast<IUnknown **>(g.items.Out()));
    std::vector<OPCITEMDEF> defs = ActiveDefinitions(ids);
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    g.items->AddItems(static_cast<DWORD>(defs.size()), defs.data(), &results, &errors);
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

// count items that all follow one member.
Group MakeGroup(IOPCServer *server, DWORD rate, const wchar_t *id, DWORD count, CountingSink *sink)
{
    return MakeGroupOf(server, rate, std::vector<std::wstring>(count, id), sink);
}

// The group made inactive: its items stay subscribed and keep taking the
// network's updates, but the scanner no longer visits it.
bool Deactivate(Group &g)
{
    ComPtr<IOPCGroupStateMgt> state;
    if (FAILED(g.items.As(state)))
        return false;
    DWORD revised = 0;
    BOOL active = FALSE;
    return SUCCEEDED(state->SetState(nullptr, &revised, &active, nullptr, nullptr, nullptr, nullptr));
}

// Unadvises and removes a group; the group's interfaces go first.
void RemoveGroupOf(IOPCServer *server, Group &g)
{
    if (g.point)
        g.point->Unadvise(g.cookie);
    OPCHANDLE handle = g.handle;
    g = Group();
    server->RemoveGroup(handle, TRUE);
}

struct DeliveryFigures {
    unsigned long long items = 0;
    double seconds = 0;
    double cpuSeconds = 0;
    bool stayedActive = true;
    double ItemsPerSecond() const { return seconds > 0 ? items / seconds : 0; }
    double CpuMicrosPerItem() const { return items ? cpuSeconds * 1e6 / items : 0; }
};

// Adds to d what the sink receives in one window, after a warm-up, and the
// processor time the sending process uses meanwhile.
void MeasureWindow(CountingSink *sink, HANDLE process, DWORD warmUpMs, DWORD windowMs, DeliveryFigures &d)
{
    Sleep(warmUpMs);
    unsigned long long before = sink->items;
    double cpuBefore = ProcessCpuSeconds(process);
    auto start = Clock::now();
    Sleep(windowMs);
    d.items += sink->items - before;
    d.seconds += std::chrono::duration<double>(Clock::now() - start).count();
    d.cpuSeconds += ProcessCpuSeconds(process) - cpuBefore;
}

// Our side: an active group of n items that all change every 10 ms scan
// ("fast" counts every 10 ms). The network updates its items as long as it
// exists, so it exists only while it is measured.
class OurGroup {
public:
    OurGroup(IOPCServer *server, DWORD n) : m_server(server), m_sink(CountingSink::Create())
    {
        m_group = MakeGroup(server, 10, L"\\\\.\\proc1\\Counters.fast", n, m_sink.Get());
        m_group.items.As(m_state);
    }
    ~OurGroup()
    {
        m_state.Reset();
        RemoveGroupOf(m_server, m_group);
    }
    OurGroup(const OurGroup &) = delete;
    OurGroup &operator=(const OurGroup &) = delete;

    // False when failed deliveries made the server deactivate the group.
    bool Active() { return StateOf(m_state.Get()).active != FALSE; }
    CountingSink *Sink() { return m_sink.Get(); }

private:
    IOPCServer *m_server;
    ComPtr<CountingSink> m_sink;
    Group m_group;
    ComPtr<IOPCGroupStateMgt> m_state;
};

DeliveryFigures InProcess(IOPCServer *server, DWORD n)
{
    OurGroup group(server, n);
    DeliveryFigures d;
    MeasureWindow(group.Sink(), GetCurrentProcess(), 500, 5000, d);
    d.stayedActive = group.Active();
    return d;
}

// The baseline side: a process of its own that sends precomputed
// OnDataChange calls of n items at the same rate while a sink is advised on
// it (see baseline_server.cpp).
class BaselineServer {
public:
    explicit BaselineServer(DWORD n)
        : m_process(n), m_point(m_process.Query<IConnectionPoint>(IID_IConnectionPoint)), m_sink(CountingSink::Create())
    {
    }
    BaselineServer(const BaselineServer &) = delete;
    BaselineServer &operator=(const BaselineServer &) = delete;

    bool Ready() const { return m_point.Get() != nullptr; }
    void Start() { m_point->Advise(static_cast<IOPCDataCallback *>(m_sink.Get()), &m_cookie); }
    void Stop() { m_point->Unadvise(m_cookie); }
    HANDLE Process() const { return m_process.Process(); }
    CountingSink *Sink() { return m_sink.Get(); }

private:
    // The process first: members end in reverse order, so the connection
    // point is released before the process waits for the baseline's end.
    BaselineProcess m_process;
    ComPtr<IConnectionPoint> m_point;
    ComPtr<CountingSink> m_sink;
    DWORD m_cookie = 0;
};

void PrintDelivery(const char *what, DWORD n, const DeliveryFigures &d)
{
    printf("  %-22s N=%-6lu %10.0f items/s  %7.3f us server CPU per item%s\n", what, static_cast<unsigned long>(n),
           d.ItemsPerSecond(), d.CpuMicrosPerItem(), d.stayedActive ? "" : "  (group deactivated: deliveries failed)");
}

// Delivery through COM, ours beside the baseline, for each item count. The
// two take turns in short windows, so that a machine whose speed drifts
// (other programs, a virtual machine's neighbours) weighs on both alike.
void CompareThroughCom(const std::vector<DWORD> &counts)
{
    const int kRounds = 4;
    const DWORD kWarmUpMs = 500, kWindowMs = 1500;
    ComPtr<IOPCServer> remote;
    if (FAILED(CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                reinterpret_cast<void **>(remote.Out())))) {
        printf("out of process: the server is not registered\n");
        return;
    }
    UniqueHandle serverProcess(OpenProcessNamed(L"Local.exe"));
    for (DWORD items : counts) {
        BaselineServer baseline(items);
        if (!baseline.Ready()) {
            printf("  the baseline server did not start\n");
            return;
        }
        DeliveryFigures base, our;
        for (int round = 0; round < kRounds; ++round) {
            baseline.Start();
            MeasureWindow(baseline.Sink(), baseline.Process(), kWarmUpMs, kWindowMs, base);
            baseline.Stop();
            OurGroup ours(remote.Get(), items);
            MeasureWindow(ours.Sink(), serverProcess.Get(), kWarmUpMs, kWindowMs, our);
            our.stayedActive = our.stayedActive && ours.Active();
        }
        PrintDelivery("baseline COM server", items, base);
        PrintDelivery("our server", items, our);
        if (base.ItemsPerSecond() > 0)
            printf("  %-22s N=%-6lu %9.0f %%\n", "ours / baseline", static_cast<unsigned long>(items),
                   100 * our.ItemsPerSecond() / base.ItemsPerSecond());
    }
}

// One window of a plant's delivery: what came, what it cost the server and
// the node, and how old the values were on arrival.
constexpr int kPlantWindows = 3;
constexpr DWORD kPlantWindowMs = 2000;

struct PlantWindow {
    double itemsPerSecond = 0, serverUs = 0, nodeUs = 0, medianMs = 0, p99Ms = 0;

    // The best of windows: start from this, and keep each window's.
    static PlantWindow NoneYet() { return {0, 1e9, 1e9, 1e9, 1e9}; }
    void Keep(const PlantWindow &w)
    {
        itemsPerSecond = std::max(itemsPerSecond, w.itemsPerSecond);
        serverUs = std::min(serverUs, w.serverUs);
        nodeUs = std::min(nodeUs, w.nodeUs);
        medianMs = std::min(medianMs, w.medianMs);
        p99Ms = std::min(p99Ms, w.p99Ms);
    }
};

PlantWindow MeasurePlantWindow(CountingSink *sink, HANDLE server, HANDLE node, DWORD windowMs)
{
    PlantWindow w;
    sink->TakeLatencies();
    sink->sampleLatency = true;
    unsigned long long before = sink->items;
    double serverBefore = ProcessCpuSeconds(server), nodeBefore = node ? ProcessCpuSeconds(node) : 0;
    auto start = Clock::now();
    Sleep(windowMs);
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    unsigned long long items = sink->items - before;
    sink->sampleLatency = false;
    w.itemsPerSecond = items / seconds;
    if (items) {
        w.serverUs = (ProcessCpuSeconds(server) - serverBefore) * 1e6 / items;
        w.nodeUs = node ? (ProcessCpuSeconds(node) - nodeBefore) * 1e6 / items : 0;
    }
    std::vector<double> ms = sink->TakeLatencies();
    std::sort(ms.begin(), ms.end());
    if (!ms.empty()) {
        w.medianMs = ms[ms.size() / 2];
        w.p99Ms = ms[ms.size() * 99 / 100];
    }
    return w;
}

// The baseline's best of as many windows as ours.
PlantWindow BestPlantWindow(CountingSink *sink, HANDLE server, DWORD windowMs)
{
    PlantWindow best = PlantWindow::NoneYet();
    for (int window = 1; window <= kPlantWindows; ++window)
        best.Keep(MeasurePlantWindow(sink, server, nullptr, windowMs));
    return best;
}

void PrintPlantWindow(const char *what, const PlantWindow &w)
{
    printf("  %-20s %9.0f items/s  %6.3f us server CPU per item  %6.3f us node CPU per item  latency median %6.1f ms, "
           "99th percentile %6.1f ms\n",
           what, w.itemsPerSecond, w.serverUs, w.nodeUs, w.medianMs, w.p99Ms);
}

// Several clients at once: each a process of its own (this program, with
// --plant-client) with an equal share of the members in a group of its own,
// all counted in the same windows, which named events open and close.
std::wstring ClientEvent(const std::wstring &prefix, const wchar_t *what, int n)
{
    return prefix + L"_" + what + std::to_wstring(n);
}

// A client's side: prints, for each window, "window W ITEMS" and the ages of
// its sampled values in ms.
int PlantClient(DWORD first, DWORD count, int index, const std::wstring &prefix)
{
    ComPtr<IOPCServer> server;
    HRESULT hr = CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                  reinterpret_cast<void **>(server.Out()));
    if (FAILED(hr)) {
        printf("error 0x%08lX CoCreateInstance\n", static_cast<unsigned long>(hr));
        return 1;
    }
    ComPtr<CountingSink> sink = CountingSink::Create();
    Group group = MakeGroupOf(server.Get(), 10, DistinctChangingIds(first, count), sink.Get());
    Sleep(2000); // first values, and the scans settled
    UniqueHandle ready(OpenEventW(EVENT_MODIFY_STATE, FALSE, ClientEvent(prefix, L"ready", index).c_str()));
    SetEvent(ready.Get());
    for (int window = 1; window <= kPlantWindows; ++window) {
        UniqueHandle start(OpenEventW(SYNCHRONIZE, FALSE, ClientEvent(prefix, L"start", window).c_str()));
        UniqueHandle end(OpenEventW(SYNCHRONIZE, FALSE, ClientEvent(prefix, L"end", window).c_str()));
        if (WaitForSingleObject(start.Get(), 120000) != WAIT_OBJECT_0)
            break;
        sink->TakeLatencies();
        sink->sampleLatency = true;
        unsigned long long before = sink->items;
        WaitForSingleObject(end.Get(), 120000);
        unsigned long long items = sink->items - before;
        sink->sampleLatency = false;
        printf("window %d %llu", window, items);
        for (double ms : sink->TakeLatencies())
            printf(" %.2f", ms);
        printf("\n");
    }
    RemoveGroupOf(server.Get(), group);
    return 0;
}

// What the clients printed for one window: items per client, and every
// sampled age.
struct ClientReports {
    std::vector<unsigned long long> items;
    std::vector<double> ms;
};

void ReadClientReport(const std::string &output, std::vector<ClientReports> &windows)
{
    size_t at = 0;
    while (at < output.size()) {
        size_t end = output.find('\n', at);
        std::string line = output.substr(at, end == std::string::npos ? std::string::npos : end - at);
        at = end == std::string::npos ? output.size() : end + 1;
        int window = 0, used = 0;
        unsigned long long items = 0;
        if (sscanf(line.c_str(), "window %d %llu%n", &window, &items, &used) != 2 || window < 1 ||
            window > kPlantWindows)
            continue;
        ClientReports &w = windows[window - 1];
        w.items.push_back(items);
        const char *p = line.c_str() + used;
        char *next = nullptr;
        for (double ms = strtod(p, &next); next != p; p = next, ms = strtod(p, &next))
            w.ms.push_back(ms);
    }
}

// Each window's figures over all clients, and the best of them.
void PrintClientWindows(std::vector<ClientReports> &windows, const std::vector<double> &seconds,
                        const std::vector<double> &serverCpu, const std::vector<double> &nodeCpu, int clients)
{
    PlantWindow best = PlantWindow::NoneYet();
    for (int w = 0; w < kPlantWindows; ++w) {
        ClientReports &r = windows[w];
        unsigned long long items = 0, fewest = ~0ull, most = 0;
        for (unsigned long long n : r.items) {
            items += n;
            fewest = std::min(fewest, n);
            most = std::max(most, n);
        }
        PlantWindow pw;
        pw.itemsPerSecond = items / seconds[w];
        pw.serverUs = items ? serverCpu[w] * 1e6 / items : 0;
        pw.nodeUs = items ? nodeCpu[w] * 1e6 / items : 0;
        std::sort(r.ms.begin(), r.ms.end());
        if (!r.ms.empty()) {
            pw.medianMs = r.ms[r.ms.size() / 2];
            pw.p99Ms = r.ms[r.ms.size() * 99 / 100];
        }
        PrintPlantWindow(("window " + std::to_string(w + 1)).c_str(), pw);
        printf("  %-20s %zu of %d clients reported, each %.0f to %.0f items/s\n", "", r.items.size(), clients,
               r.items.empty() ? 0.0 : fewest / seconds[w], most / seconds[w]);
        best.Keep(pw);
    }
    PrintPlantWindow("best of the three", best);
}

void SeveralClients(DWORD members, int clients)
{
    UniqueHandle serverProcess(OpenProcessNamed(L"Local.exe"));
    UniqueHandle node(OpenProcessNamed(L"cadronode.exe"));
    const std::wstring prefix = L"subscription_bench_" + std::to_wstring(GetCurrentProcessId());
    std::vector<UniqueHandle> ready, starts, ends;
    for (int i = 0; i < clients; ++i)
        ready.emplace_back(CreateEventW(nullptr, TRUE, FALSE, ClientEvent(prefix, L"ready", i).c_str()));
    for (int w = 1; w <= kPlantWindows; ++w) {
        starts.emplace_back(CreateEventW(nullptr, TRUE, FALSE, ClientEvent(prefix, L"start", w).c_str()));
        ends.emplace_back(CreateEventW(nullptr, TRUE, FALSE, ClientEvent(prefix, L"end", w).c_str()));
    }
    std::vector<std::string> outputs(clients);
    std::vector<std::thread> runners;
    const DWORD share = members / clients;
    for (int i = 0; i < clients; ++i) {
        std::wstring line = L"\"" + BesideThisProgram(L"subscription_bench.exe") + L"\" --plant-client " +
                            std::to_wstring(i * share) + L" " + std::to_wstring(share) + L" " + std::to_wstring(i) +
                            L" " + prefix;
        runners.emplace_back([&outputs, i, line] { RunAndCapture(line, outputs[i], 300000); });
    }
    bool allReady = true;
    for (UniqueHandle &r : ready)
        allReady = allReady && WaitForSingleObject(r.Get(), 120000) == WAIT_OBJECT_0;
    std::vector<double> seconds(kPlantWindows), serverCpu(kPlantWindows), nodeCpu(kPlantWindows);
    for (int w = 0; w < kPlantWindows; ++w) {
        double serverBefore = ProcessCpuSeconds(serverProcess.Get());
        double nodeBefore = node ? ProcessCpuSeconds(node.Get()) : 0;
        auto start = Clock::now();
        SetEvent(starts[w].Get());
        if (allReady)
            Sleep(kPlantWindowMs);
        SetEvent(ends[w].Get());
        seconds[w] = std::chrono::duration<double>(Clock::now() - start).count();
        serverCpu[w] = ProcessCpuSeconds(serverProcess.Get()) - serverBefore;
        nodeCpu[w] = node ? ProcessCpuSeconds(node.Get()) - nodeBefore : 0;
    }
    for (std::thread &runner : runners)
        runner.join();
    if (!allReady) {
        printf("  not every client got ready within 2 minutes:\n");
        for (const std::string &output : outputs)
            printf("    %s\n", output.substr(0, output.find('\n')).c_str());
        return;
    }
    std::vector<ClientReports> windows(kPlantWindows);
    for (const std::string &output : outputs)
        ReadClientReport(output, windows);
    PrintClientWindows(windows, seconds, serverCpu, nodeCpu, clients);
}

void Distinct(DWORD members, int clients)
{
    if (CountServerProcesses() != 0) {
        printf("a server process is running already: it serves another network; stop it first\n");
        return;
    }
    DistinctNetwork network(members);
    if (!network.Error().empty()) {
        printf("%ls\n", network.Error().c_str());
        return;
    }
    ComPtr<IOPCServer> server;
    if (FAILED(CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                reinterpret_cast<void **>(server.Out())))) {
        printf("the server is not registered: run ./test.sh or scripts/setup.sh first\n");
        return;
    }
    if (clients > 1) {
        printf("%lu items on distinct members counting every 10 ms, %d clients at once, each a process with an active "
               "10 ms group of %lu of them, through COM:\n",
               static_cast<unsigned long>(members), clients, static_cast<unsigned long>(members / clients));
        SeveralClients(members, clients); // server held: its process stays while the clients start
        return;
    }
    UniqueHandle serverProcess(OpenProcessNamed(L"Local.exe"));
    UniqueHandle node(OpenProcessNamed(L"cadronode.exe"));
    const DWORD kWindowMs = kPlantWindowMs;
    printf("%lu items on distinct members counting every 10 ms, one active 10 ms group, through COM:\n",
           static_cast<unsigned long>(members));
    PlantWindow best = PlantWindow::NoneYet();
    // The baseline is measured twice: beside the network's load (our items
    // still subscribed, in a group made inactive: the node computes and our
    // server takes a million updates a second, but nothing is scanned or
    // called back), and alone. On two processors the load takes its share
    // from the callbacks' transport; the first is the floor of our figures.
    BaselineServer baseline(members);
    PlantWindow loadedFloor;
    {
        ComPtr<CountingSink> sink = CountingSink::Create();
        Group group = MakeGroupOf(server.Get(), 10, network.Changing(members), sink.Get());
        Sleep(2000); // first values, and the scans settled
        for (int window = 1; window <= kPlantWindows; ++window) {
            PlantWindow w = MeasurePlantWindow(sink.Get(), serverProcess.Get(), node.Get(), kWindowMs);
            PrintPlantWindow(("window " + std::to_string(window)).c_str(), w);
            best.Keep(w);
        }
        if (baseline.Ready() && Deactivate(group)) {
            Sleep(500);
            baseline.Start();
            Sleep(500);
            loadedFloor = BestPlantWindow(baseline.Sink(), baseline.Process(), kWindowMs);
            baseline.Stop();
        }
        RemoveGroupOf(server.Get(), group);
    }
    PrintPlantWindow("best of the three", best);
    if (!baseline.Ready()) {
        printf("  the baseline server did not start\n");
        return;
    }
    Sleep(500);
    baseline.Start();
    Sleep(500);
    PlantWindow floor = BestPlantWindow(baseline.Sink(), baseline.Process(), kWindowMs);
    baseline.Stop();
    printf("  %-20s %9.0f items/s  %6.3f us server CPU per item (precomputed callbacks of %lu items; beside the "
           "network's load: %.0f items/s, %.3f us)\n",
           "baseline COM server", floor.itemsPerSecond, floor.serverUs, static_cast<unsigned long>(members),
           loadedFloor.itemsPerSecond, loadedFloor.serverUs);
}
} // namespace

// With item counts as arguments only the comparison through COM runs, for
// those counts in turn (repeat a count to see how much it varies).
int wmain(int argc, wchar_t **argv)
{
    if (argc > 1 && wcscmp(argv[1], L"--distinct") == 0) {
        // The network node's, which the server reaches too.
        DWORD members = 10000;
        int clients = 1;
        for (int i = 2; i < argc; ++i) {
            if (wcscmp(argv[i], L"--clients") == 0 && i + 1 < argc)
                clients = _wtoi(argv[++i]);
            else
                members = wcstoul(argv[i], nullptr, 10);
        }
        if (clients < 1 || clients > 32 || members < static_cast<DWORD>(clients)) {
            fprintf(stderr, "usage: subscription_bench --distinct [N] [--clients K] (1 <= K <= 32, K <= N)\n");
            return 1;
        }
        CoInitializeEx(nullptr, COINIT_MULTITHREADED);
        Distinct(members, clients);
        CoUninitialize();
        return 0;
    }
    if (argc == 6 && wcscmp(argv[1], L"--plant-client") == 0) {
        CoInitializeEx(nullptr, COINIT_MULTITHREADED);
        int code = PlantClient(wcstoul(argv[2], nullptr, 10), wcstoul(argv[3], nullptr, 10), _wtoi(argv[4]), argv[5]);
        CoUninitialize();
        return code;
    }
    CadroSim_UseEmbeddedNetwork(); // the network of the objects made in this process
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    if (argc > 1 && wcscmp(argv[1], L"-i") == 0)
        inProcessOnly = true;
    else if (argc > 1) {
        std::vector<DWORD> counts;
        for (int i = 1; i < argc; ++i)
            counts.push_back(wcstoul(argv[i], nullptr, 10));
        CompareThroughCom(counts);
        CoUninitialize();
        return 0;
    }
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
        Delivery columns(0);
        group->Scan(next, columns);
        const int scans = 200;
        auto start = Clock::now();
        for (int i = 0; i < scans; ++i)
            group->Scan(next, columns);
        double ns = std::chrono::duration<double, std::nano>(Clock::now() - start).count() / (double(scans) * n);
        printf("scan cost per unchanged active item: %.1f ns (%lu items, %d scans)\n", ns,
               static_cast<unsigned long>(n), scans);
        state.Reset();
        RemoveGroupOf(server.Get(), quiet);

        // Scan cost per changed item, the work a scan adds to each delivery:
        // every item has changed since the last scan, and no sink is advised.
        Group busy = MakeGroup(server.Get(), 3600000, L"\\\\.\\proc1\\Counters.fast", n, nullptr);
        Sleep(300);
        busy.items.As(state);
        group = static_cast<COPCGroup *>(state.Get());
        // What the network's updates cost the process meanwhile: the group is
        // not scanned, every item gets a value every 10 ms.
        double cpu0 = ProcessCpuSeconds(GetCurrentProcess());
        Sleep(2000);
        printf("network update of an item, processor time: %.1f ns (%lu items every 10 ms)\n",
               (ProcessCpuSeconds(GetCurrentProcess()) - cpu0) * 1e9 / (200.0 * n), static_cast<unsigned long>(n));
        double changedNs = 0;
        for (int i = 0; i < 50; ++i) {
            Sleep(15);
            auto t0 = Clock::now();
            group->Scan(next, columns);
            changedNs += std::chrono::duration<double, std::nano>(Clock::now() - t0).count();
        }
        printf("scan cost per changed active item: %.1f ns (%lu items, 50 scans)\n", changedNs / (50.0 * n),
               static_cast<unsigned long>(n));
        state.Reset();
        RemoveGroupOf(server.Get(), busy);

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
        RemoveGroupOf(server.Get(), g);

        printf("items delivered through OnDataChange, every item changing every 10 ms scan:\n");
        for (DWORD items : {100u, 1000u, 10000u})
            PrintDelivery("in process", items, InProcess(server.Get(), items));
    }
    if (!inProcessOnly)
        CompareThroughCom({100, 1000, 10000});
    CoUninitialize();
    return 0;
}

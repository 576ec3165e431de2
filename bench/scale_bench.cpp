// Plant-size item counts, measured as a SCADA client meets them: through COM
// from this process against the registered local server. It writes its own
// network description (for N = 1,000, 10,000 and 100,000: one object of N
// members, and 100 objects of N/100 members), loads it into the network node
// for the length of the run ("cadroctl load"; "reset" after), and prints:
// - AddItems of N distinct items, all in one object and spread over 100
//   objects: the first call and the best of three, with the time per item;
// - ValidateItems of 10,000 items;
// - cache Read of 1,000 and 10,000 items;
// - the server's memory per item at 100,000 items (growth of its working
//   set while the items are added, divided by the items; once with the
//   address space still to be read, once with it read already by a
//   ValidateItems of the same identifiers), and the time of the RemoveGroup
//   of such a group.
// - the network node's memory per subscription (the same items).
// Beside each time it prints the floor: the same call, in turns with ours,
// answered by baseline_server, which looks nothing up and sends the least a
// server must send; what is left above it is our server's and its network's.
// No other server process may run meanwhile.
//
// With --distinct it measures a plant's items instead (DistinctNetwork.h):
// memory per item (server and node) at 100,000 items in 10 groups over
// 10,000 members that count every 10 ms, AddItems of 10,000 distinct such
// items (and ValidateItems of them: the lookups alone), and a cache Read
// of 1,000 of them while they change beside the same Read of constant ones.
#include "BaselineProcess.h"
#include "CadroSim.h"
#include "ComPtr.h"
#include "DistinctNetwork.h"
#include "Handle.h"
#include "ItemDefinitions.h"
#include "ProcessTimes.h"
#include "ServerProcesses.h"
#include "opcda.h"

#include <psapi.h>
#include <tlhelp32.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

namespace {
using Clock = std::chrono::steady_clock;
const CLSID kServer = {0x5b1e7a20, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};
const DWORD kCounts[] = {1000, 10000, 100000};
const DWORD kSpreadObjects = 100;

double Ms(Clock::time_point from)
{
    return std::chrono::duration<double, std::milli>(Clock::now() - from).count();
}

std::wstring OneObjectId(DWORD n, DWORD i)
{
    return L"\\\\.\\scale\\Flat" + std::to_wstring(n) + L".m" + std::to_wstring(i);
}

// The N members of the spread layout of N are those of its 100 objects:
// a lookup reads every member of an object it descends into.
std::wstring SpreadId(DWORD n, DWORD i)
{
    return L"\\\\.\\scale\\Spread" + std::to_wstring(n) + L"\\S" + std::to_wstring(i % kSpreadObjects) + L".m" +
           std::to_wstring(i / kSpreadObjects);
}

// The layouts, and one more object of 100,000 members ("Fresh") for the
// memory figure, whose nodes the address space has not read before.
std::string Description()
{
    std::string text = "machine $HOST\nprocess scale\n";
    for (DWORD n : kCounts) {
        text += "object Flat" + std::to_string(n) + "\n";
        for (DWORD i = 0; i < n; ++i)
            text += "member m" + std::to_string(i) + " value=" + std::to_string(i % 97) + "\n";
    }
    text += "object Fresh\n";
    for (DWORD i = 0; i < 100000; ++i)
        text += "member m" + std::to_string(i) + " value=1\n";
    for (DWORD n : kCounts)
        for (DWORD o = 0; o < kSpreadObjects; ++o) {
            text += "object Spread" + std::to_string(n) + "\\S" + std::to_string(o) + "\n";
            for (DWORD i = 0; i < n / kSpreadObjects; ++i)
                text += "member m" + std::to_string(i) + " value=2\n";
        }
    return text;
}

double WorkingSetKB(HANDLE process)
{
    PROCESS_MEMORY_COUNTERS counters = {};
    counters.cb = sizeof counters;
    if (!process || !GetProcessMemoryInfo(process, &counters, sizeof counters))
        return 0;
    return counters.WorkingSetSize / 1024.0;
}

// AddItems of every id in one call: its time in ms, -1 when it failed; the
// server handles go to handles when given.
double AddAll(IOPCItemMgt *items, const std::vector<std::wstring> &ids, std::vector<OPCHANDLE> *handles = nullptr)
{
    std::vector<OPCITEMDEF> defs = ActiveDefinitions(ids);
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    auto start = Clock::now();
    HRESULT hr = items->AddItems(static_cast<DWORD>(defs.size()), defs.data(), &results, &errors);
    double ms = Ms(start);
    if (hr != S_OK) {
        printf("  AddItems failed: 0x%08lX\n", static_cast<unsigned long>(hr));
        ms = -1;
    }
    for (size_t i = 0; handles && results && i < defs.size(); ++i)
        handles->push_back(results[i].hServer);
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
    return ms;
}

// ValidateItems of every id in one call: its time in ms.
double ValidateAll(IOPCItemMgt *items, const std::vector<std::wstring> &ids, HRESULT *hr = nullptr)
{
    std::vector<OPCITEMDEF> defs = ActiveDefinitions(ids);
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    auto start = Clock::now();
    HRESULT result = items->ValidateItems(static_cast<DWORD>(defs.size()), defs.data(), FALSE, &results, &errors);
    double ms = Ms(start);
    if (hr)
        *hr = result;
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
    return ms;
}

// A cache read of handles: its time in ms.
double ReadAll(IOPCSyncIO *io, std::vector<OPCHANDLE> &handles, HRESULT *hr = nullptr)
{
    const DWORD n = static_cast<DWORD>(handles.size());
    OPCITEMSTATE *states = nullptr;
    HRESULT *errors = nullptr;
    auto start = Clock::now();
    HRESULT result = io->Read(OPC_DS_CACHE, n, handles.data(), &states, &errors);
    double ms = Ms(start);
    if (hr)
        *hr = result;
    for (DWORD i = 0; states && i < n; ++i)
        VariantClear(&states[i].vDataValue);
    CoTaskMemFree(states);
    CoTaskMemFree(errors);
    return ms;
}

// The baseline server's item management and reads, the floor of each
// figure. The interfaces go before the process (members end in reverse
// order), which waits for the baseline to end once released.
struct Floor {
    BaselineProcess process{1};
    ComPtr<IOPCItemMgt> items = process.Query<IOPCItemMgt>(IID_IOPCItemMgt);
    ComPtr<IOPCSyncIO> io = process.Query<IOPCSyncIO>(IID_IOPCSyncIO);
    bool Ready() const { return items && io; }
};

// A group of the server with the definitions of ids, all active.
class Group {
public:
    Group(IOPCServer *server, const wchar_t *name) : m_server(server)
    {
        DWORD rate = 0;
        m_server->AddGroup(name, TRUE, 1000, 0, nullptr, nullptr, 0, &m_handle, &rate, IID_IOPCItemMgt,
                           reinterpret_cast<IUnknown **>(m_items.Out()));
    }
    ~Group() { Remove(); }
    // RemoveGroup: its time in ms (the group's items go with it).
    double Remove()
    {
        if (!m_items)
            return 0;
        m_items = nullptr;
        auto start = Clock::now();
        m_server->RemoveGroup(m_handle, TRUE);
        return Ms(start);
    }
    Group(const Group &) = delete;
    Group &operator=(const Group &) = delete;

    IOPCItemMgt *Items() const { return m_items.Get(); }
    const std::vector<OPCHANDLE> &Handles() const { return m_handles; }

    double Add(const std::vector<std::wstring> &ids) { return AddAll(m_items.Get(), ids, &m_handles); }
    void Validate(const std::vector<std::wstring> &ids) { ValidateAll(m_items.Get(), ids); }

private:
    IOPCServer *m_server;
    OPCHANDLE m_handle = 0;
    ComPtr<IOPCItemMgt> m_items;
    std::vector<OPCHANDLE> m_handles;
};

std::vector<std::wstring> Ids(DWORD n, bool spread)
{
    std::vector<std::wstring> ids;
    ids.reserve(n);
    for (DWORD i = 0; i < n; ++i)
        ids.push_back(spread ? SpreadId(n, i) : OneObjectId(n, i));
    return ids;
}

void AddItemsFigures(IOPCServer *server, const Floor &floor)
{
    // The first call of each layout reads its nodes for the first time;
    // later ones merge what the network gives into nodes that exist (a
    // client that adds its items again after a restart of its own). The
    // best of three is the machine's noise taken out.
    const int runs = 3;
    printf("AddItems of N distinct items, one call, through COM (first call, best of %d; the floor's best):\n", runs);
    double perItemAt1000[2] = {0, 0};
    for (DWORD n : kCounts) {
        for (int spread = 0; spread < 2; ++spread) {
            std::vector<std::wstring> ids = Ids(n, spread != 0);
            double first = 0, best = 1e12, floorBest = 1e12;
            for (int run = 0; run < runs; ++run) {
                Group group(server, L"scale");
                double ms = group.Add(ids);
                first = run == 0 ? ms : first;
                best = ms < best ? ms : best;
                floorBest = std::min(floorBest, AddAll(floor.items.Get(), ids));
            }
            double perItem = best * 1000.0 / n;
            if (n == 1000)
                perItemAt1000[spread] = perItem;
            printf("  N=%-7lu %-26s %8.1f ms %8.1f ms  %6.2f us per item  floor %7.1f ms",
                   static_cast<unsigned long>(n), spread ? "spread over 100 objects" : "one object of N members", first,
                   best, perItem, floorBest);
            if (n != 1000 && perItemAt1000[spread] > 0)
                printf("  (%.2f x the time per item at 1,000)", perItem / perItemAt1000[spread]);
            printf("\n");
        }
    }
}

void ValidateFigure(IOPCServer *server, const Floor &floor)
{
    Group group(server, L"validate");
    std::vector<std::wstring> ids = Ids(10000, true);
    HRESULT hr = S_OK;
    double ms = ValidateAll(group.Items(), ids, &hr);
    double floorMs = ValidateAll(floor.items.Get(), ids);
    printf("ValidateItems of 10,000 items: %.1f ms (0x%08lX), floor %.1f ms\n", ms, static_cast<unsigned long>(hr),
           floorMs);
}

void ReadFigures(IOPCServer *server, const Floor &floor)
{
    Group group(server, L"read");
    group.Add(Ids(10000, true));
    ComPtr<IOPCSyncIO> io;
    group.Items()->QueryInterface(IID_IOPCSyncIO, reinterpret_cast<void **>(io.Out()));
    for (DWORD n : {1000ul, 10000ul}) {
        std::vector<OPCHANDLE> handles(group.Handles().begin(), group.Handles().begin() + n);
        double best = 1e9, total = 0, floorBest = 1e9;
        const int runs = 20;
        HRESULT hr = S_OK;
        for (int run = 0; run <= runs; ++run) {
            double ms = ReadAll(io.Get(), handles, &hr);
            if (run > 0) { // the first read may wait for first values
                best = ms < best ? ms : best;
                total += ms;
            }
            floorBest = std::min(floorBest, ReadAll(floor.io.Get(), handles));
        }
        printf("cache Read of %lu items: best %.2f ms, mean %.2f ms (0x%08lX), floor %.2f ms\n", n, best, total / runs,
               static_cast<unsigned long>(hr), floorBest);
    }
}

// The working set once the process has no more threads than it had before:
// the adds read the address space ahead with the thread pool's threads,
// which the pool lets go after some seconds idle (five under Wine, where
// each costs a megabyte of working set), and which are no item's memory.
// Waits ten seconds at most.
double SettledWorkingSetKB(HANDLE process, unsigned long threads)
{
    for (int wait = 0; wait < 40 && ProcessThreadCount(process) > threads; ++wait)
        Sleep(250);
    Sleep(250);
    return WorkingSetKB(process);
}

void MemoryFigures(IOPCServer *server)
{
    UniqueHandle process(OpenProcessNamed(L"Local.exe"));
    UniqueHandle node(OpenProcessNamed(L"cadronode.exe"));
    if (WorkingSetKB(process.Get()) == 0) {
        printf("server memory: the server's working set cannot be read\n");
        return;
    }
    const DWORD n = 100000;
    std::vector<std::wstring> fresh, known = Ids(n, false);
    for (DWORD i = 0; i < n; ++i)
        fresh.push_back(L"\\\\.\\scale\\Fresh.m" + std::to_wstring(i));
    Sleep(500);
    Group first(server, L"memory");
    double before = WorkingSetKB(process.Get());
    double nodeBefore = WorkingSetKB(node.Get());
    first.Add(fresh);
    Sleep(500);
    double afterFresh = WorkingSetKB(process.Get());
    double nodeAfter = WorkingSetKB(node.Get());
    // Items whose nodes a ValidateItems of the same identifiers has read
    // (and whose call buffers it has had): what the items alone cost.
    Group second(server, L"memory2");
    second.Validate(known);
    Sleep(500);
    double beforeKnown = WorkingSetKB(process.Get());
    second.Add(known);
    Sleep(500);
    double afterKnown = WorkingSetKB(process.Get());
    printf("server memory per item at 100,000 items: %.3f KB with the address space to read, %.3f KB with it read\n",
           (afterFresh - before) / n, (afterKnown - beforeKnown) / n);
    // The subscriptions themselves live in the network node.
    printf("network node memory per subscription: %.3f KB\n", (nodeAfter - nodeBefore) / n);
    printf("RemoveGroup of a group of 100,000 items: %.1f ms\n", second.Remove());
}

// Best and mean of a cache Read of the first n handles, 20 reads after one
// that may wait for first values.
void ReadFigure(const char *what, IOPCItemMgt *items, const std::vector<OPCHANDLE> &all, DWORD n, double &best)
{
    ComPtr<IOPCSyncIO> io;
    items->QueryInterface(IID_IOPCSyncIO, reinterpret_cast<void **>(io.Out()));
    std::vector<OPCHANDLE> handles(all.begin(), all.begin() + std::min<size_t>(n, all.size()));
    double total = 0;
    const int runs = 20;
    HRESULT hr = S_OK;
    best = 1e9;
    for (int run = 0; run <= runs; ++run) {
        double ms = ReadAll(io.Get(), handles, &hr);
        if (run > 0) {
            best = std::min(best, ms);
            total += ms;
        }
    }
    printf("  cache Read of %lu items %-28s best %.2f ms, mean %.2f ms (0x%08lX)\n", static_cast<unsigned long>(n),
           what, best, total / runs, static_cast<unsigned long>(hr));
}

void DistinctFigures(IOPCServer *server, const DistinctNetwork &network, const Floor &floor)
{
    const DWORD members = 10000, groups = 10;
    std::vector<std::wstring> changing = network.Changing(members), constant = network.Constant(members);
    UniqueHandle process(OpenProcessNamed(L"Local.exe"));
    UniqueHandle node(OpenProcessNamed(L"cadronode.exe"));
    printf("%lu distinct members counting every 10 ms, through COM:\n", static_cast<unsigned long>(members));
    {
        // Memory first: the address space is still to be read.
        Sleep(500);
        double before = WorkingSetKB(process.Get()), nodeBefore = WorkingSetKB(node.Get());
        unsigned long threadsBefore = ProcessThreadCount(process.Get());
        std::vector<std::unique_ptr<Group>> all;
        auto start = Clock::now();
        for (DWORD g = 0; g < groups; ++g) {
            all.push_back(std::make_unique<Group>(server, (L"plant" + std::to_wstring(g)).c_str()));
            all.back()->Add(changing);
        }
        double addMs = Ms(start);
        Sleep(1000);
        double after = WorkingSetKB(process.Get()), nodeAfter = WorkingSetKB(node.Get());
        unsigned long threadsAfter = ProcessThreadCount(process.Get());
        const double items = static_cast<double>(members) * groups;
        printf("  memory per item at %.0f items in %lu groups: %.3f KB in the server, %.3f KB in the node (added in "
               "%.0f ms)\n",
               items, static_cast<unsigned long>(groups), (after - before) / items, (nodeAfter - nodeBefore) / items,
               addMs);
        double settled = SettledWorkingSetKB(process.Get(), threadsBefore);
        printf("  the same once the threads that the adds started have left (%lu -> %lu -> %lu threads): %.3f KB in "
               "the server\n",
               threadsBefore, threadsAfter, ProcessThreadCount(process.Get()), (settled - before) / items);
        start = Clock::now();
        all.clear();
        printf("  RemoveGroup of the %lu groups while their items change: %.1f ms\n",
               static_cast<unsigned long>(groups), Ms(start));
    }
    // Beside each AddItems, a ValidateItems of the same identifiers: the
    // lookups alone (every call reads each object it meets once more), so
    // that what is left is the making of the items and their subscriptions.
    double first = 0, best = 1e12, floorBest = 1e12, validateBest = 1e12, validateFloor = 1e12;
    for (int run = 0; run < 3; ++run) {
        Group group(server, L"add");
        validateBest = std::min(validateBest, ValidateAll(group.Items(), changing));
        validateFloor = std::min(validateFloor, ValidateAll(floor.items.Get(), changing));
        double ms = group.Add(changing);
        first = run == 0 ? ms : first;
        best = std::min(best, ms);
        floorBest = std::min(floorBest, AddAll(floor.items.Get(), changing));
    }
    printf("  AddItems of %lu distinct items: first %.1f ms, best of 3 %.1f ms, floor %.1f ms\n",
           static_cast<unsigned long>(members), first, best, floorBest);
    printf("  ValidateItems of the same identifiers (their lookups alone): best of 3 %.1f ms, floor %.1f ms\n",
           validateBest, validateFloor);
    Group moving(server, L"moving"), still(server, L"still");
    moving.Add(changing);
    still.Add(constant);
    Sleep(1000);
    double changingBest = 0, constantBest = 0;
    ReadFigure("while they change:", moving.Items(), moving.Handles(), 1000, changingBest);
    ReadFigure("of constant members:", still.Items(), still.Handles(), 1000, constantBest);
    if (constantBest > 0)
        printf("  changing / constant: %.2f\n", changingBest / constantBest);
}
} // namespace

int main(int argc, char **argv)
{
    if (CountServerProcesses() != 0) {
        printf("a server process is running already: it serves another network; stop it first\n");
        return 1;
    }
    if (argc > 1 && strcmp(argv[1], "--distinct") == 0) {
        DistinctNetwork network(10000);
        if (!network.Error().empty()) {
            printf("%ls\n", network.Error().c_str());
            return 1;
        }
        CoInitializeEx(nullptr, COINIT_MULTITHREADED);
        {
            ComPtr<IOPCServer> server;
            Floor floor;
            if (FAILED(CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                        reinterpret_cast<void **>(server.Out()))) ||
                !floor.Ready())
                printf("the server is not registered or the baseline server did not start\n");
            else
                DistinctFigures(server.Get(), network, floor);
        }
        CoUninitialize();
        return 0;
    }
    std::wstring path = BesideThisProgram(L"scale_network.txt");
    if (!WriteTextFile(path, Description())) {
        printf("cannot write %ls\n", path.c_str());
        return 1;
    }
    // Into the network node (started when none runs) for the length of the
    // run; then back to its configured description.
    BSTR answer = nullptr;
    HRESULT loaded = CadroSim_Execute((L"load \"" + path + L"\"").c_str(), &answer);
    if (loaded != S_OK) {
        printf("the network node did not take the description: %ls\n", answer ? answer : L"");
        SysFreeString(answer);
        return 1;
    }
    SysFreeString(answer);
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    {
        ComPtr<IOPCServer> server;
        HRESULT hr = CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                      reinterpret_cast<void **>(server.Out()));
        if (FAILED(hr)) {
            printf("the server is not registered (0x%08lX): run ./test.sh or scripts/setup.sh first\n",
                   static_cast<unsigned long>(hr));
        } else {
            MemoryFigures(server.Get());
            Floor floor;
            if (!floor.Ready()) {
                printf("the baseline server did not start\n");
            } else {
                AddItemsFigures(server.Get(), floor);
                ValidateFigure(server.Get(), floor);
                ReadFigures(server.Get(), floor);
            }
        }
    }
    CoUninitialize();
    CadroSim_Execute(L"reset", &answer);
    SysFreeString(answer);
    return 0;
}

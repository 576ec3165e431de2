// The network node seen from outside: values outlive the processes that
// wrote them, several processes (two servers among them) share one network,
// a node that dies is reported to every subscription and started again,
// which then resume, and a machine that another node serves is reached
// through this machine's node over TCP.
#include "ChildProcess.h"
#include "ComPtr.h"
#include "Handle.h"
#include "OpcRunner.h"
#include "ServerProcess.h"
#include "TestNetwork.h"
#include "TestSink.h"
#include "opcda.h"

#include <winsock2.h>

#include <gtest/gtest.h>

#include <future>
#include <ocidl.h>

namespace {
const wchar_t kTemperature[] = L"\\\\.\\proc1\\Setpoints.temperature";

bool HasDataChange(const std::vector<Callback> &calls, double value)
{
    for (const auto &c : calls)
        if (c.kind == Callback::DataChange)
            for (double v : c.values)
                if (v == value)
                    return true;
    return false;
}

bool HasValueFor(const std::vector<Callback> &calls, OPCHANDLE client, double value)
{
    for (const auto &c : calls)
        if (c.kind == Callback::DataChange)
            for (size_t i = 0; i < c.values.size() && i < c.clients.size(); ++i)
                if (c.clients[i] == client && c.values[i] == value)
                    return true;
    return false;
}

// Waits for a node other than previous to answer cadroctl.
bool WaitForNewNode(DWORD previous, DWORD timeoutMs)
{
    for (DWORD waited = 0; waited < timeoutMs; waited += 100) {
        DWORD pid = NodeProcessId();
        std::string output;
        if (pid && pid != previous && RunCadroctl(L"status", output) == 0)
            return true;
        Sleep(100);
    }
    return false;
}

// The lines of text from the first that starts with from.
// node_client on a member, printing what it is told until the last value
// arrives; returns once its subscription has had its first value (false
// when it has none within a minute).
bool StartNodeClient(const std::wstring &url, int seconds, int last, std::future<std::string> &printed)
{
    std::wstring name =
        L"NodeE2EClientReady-" + std::to_wstring(GetCurrentProcessId()) + L"-" + std::to_wstring(GetTickCount64());
    UniqueHandle ready(CreateEventW(nullptr, TRUE, FALSE, name.c_str()));
    if (!ready)
        return false;
    std::wstring command = L"\"" + BinPath(L"node_client.exe") + L"\" --ready " + name + L" " + url + L" " +
                           std::to_wstring(seconds) + L" " + std::to_wstring(last);
    printed = std::async(std::launch::async, [command, seconds] {
        std::string output;
        RunAndCapture(command, output, (seconds + 20) * 1000);
        return output;
    });
    return WaitForSingleObject(ready.Get(), 60000) == WAIT_OBJECT_0;
}

std::string From(const std::string &text, const std::string &from)
{
    size_t at = text.find(from);
    return at == std::string::npos ? std::string() : text.substr(at);
}

// The server COM starts, with an active group whose sink has seen the
// first value of its item (the described value of kTemperature).
struct Subscribed {
    void Start()
    {
        ASSERT_NO_FATAL_FAILURE(Create());
        ASSERT_NO_FATAL_FAILURE(Add(kTemperature, 21.5));
    }
    void Create()
    {
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
    }
    void Add(const wchar_t *id, double first)
    {
        OPCHANDLE group = 0;
        DWORD rate = 0;
        ASSERT_EQ(server->AddGroup(L"node", TRUE, 50, 0, nullptr, nullptr, 0, &group, &rate, IID_IOPCItemMgt,
                                   reinterpret_cast<IUnknown **>(items.Out())),
                  S_OK);
        ComPtr<IConnectionPointContainer> container;
        ASSERT_EQ(items.As(container), S_OK);
        ASSERT_EQ(container->FindConnectionPoint(IID_IOPCDataCallback, point.Out()), S_OK);
        ASSERT_EQ(point->Advise(&sink, &cookie), S_OK);
        OPCITEMDEF def = {};
        def.szItemID = const_cast<wchar_t *>(id);
        def.bActive = TRUE;
        OPCITEMRESULT *results = nullptr;
        HRESULT *errors = nullptr;
        ASSERT_EQ(items->AddItems(1, &def, &results, &errors), S_OK);
        item = results[0].hServer;
        CoTaskMemFree(results);
        CoTaskMemFree(errors);
        ASSERT_TRUE(sink.WaitFor([first](auto &calls) { return HasDataChange(calls, first); }));
    }
    // Another item of the group, active; its server handle (0 on failure).
    OPCHANDLE More(const wchar_t *id, OPCHANDLE client)
    {
        OPCITEMDEF def = {};
        def.szItemID = const_cast<wchar_t *>(id);
        def.bActive = TRUE;
        def.hClient = client;
        OPCITEMRESULT *results = nullptr;
        HRESULT *errors = nullptr;
        OPCHANDLE handle = 0;
        if (items->AddItems(1, &def, &results, &errors) == S_OK)
            handle = results[0].hServer;
        CoTaskMemFree(results);
        CoTaskMemFree(errors);
        return handle;
    }
    // Lets go of the server (its process then exits).
    void Stop()
    {
        if (point)
            point->Unadvise(cookie);
        point.Reset();
        items.Reset();
        server.Reset();
        CoDisconnectObject(&sink, 0);
    }
    ~Subscribed() { Stop(); }

    ComPtr<IOPCServer> server;
    ComPtr<IOPCItemMgt> items;
    ComPtr<IConnectionPoint> point;
    DWORD cookie = 0;
    OPCHANDLE item = 0;
    TestSink sink;
};
} // namespace

TEST(NodeE2E, AWriteIsReadBackByALaterCommand)
{
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    OpcRun write = Opc("write \\\\.\\proc1\\Setpoints.temperature 22.5");
    ASSERT_EQ(write.code, 0) << write.output;
    ASSERT_TRUE(WaitForNoServerProcess(20000)) << "the writing server did not exit";
    // Another server process, the same network.
    OpcRun read = Opc("read \\\\.\\proc1\\Setpoints.temperature");
    ASSERT_EQ(read.code, 0) << read.output;
    EXPECT_TRUE(Has(read.output, "22.5")) << read.output;
    EXPECT_NE(NodeProcessId(), 0u) << "the node outlives its clients";
}

TEST(NodeE2E, AKilledNodeIsReportedToEverySubscriptionWhichResumesOnTheNextNode)
{
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    Subscribed first;
    ASSERT_NO_FATAL_FAILURE(first.Start());
    TestSink &sink = first.sink;
    // Two items of one URL share the node's subscription: each must go on,
    // and resume, on its own once the node that held it is gone.
    ASSERT_NE(first.More(kTemperature, 2), 0u);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) { return HasValueFor(calls, 2, 21.5); }));

    // A second process on the same node, printing what it is told.
    std::future<std::string> other;
    ASSERT_TRUE(StartNodeClient(kTemperature, 40, 77, other));
    std::string out;
    EXPECT_EQ(RunCadroctl(L"publish \\\\.\\proc1\\Setpoints.temperature 31", out), 0) << out;
    ASSERT_TRUE(sink.WaitFor([](auto &calls) { return HasDataChange(calls, 31); }));

    DWORD killed = NodeProcessId();
    {
        UniqueHandle node(OpenProcess(PROCESS_TERMINATE | SYNCHRONIZE, FALSE, killed));
        ASSERT_TRUE(node);
        ASSERT_TRUE(TerminateProcess(node.Get(), 9));
        WaitForSingleObject(node.Get(), 10000);
    }
    // The libraries start a node again and subscribe anew; the new node has
    // the described value until a publish reaches both processes.
    ASSERT_TRUE(WaitForNewNode(killed, 20000));
    Sleep(500);
    EXPECT_EQ(RunCadroctl(L"publish \\\\.\\proc1\\Setpoints.temperature 77", out), 0) << out;
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasValueFor(calls, 0, 77) && HasValueFor(calls, 2, 77); }));

    std::string printed = other.get();
    EXPECT_TRUE(Has(printed, "subscribed 0x00000000")) << printed;
    EXPECT_TRUE(Has(printed, "value 31")) << printed;
    std::string afterKill = From(printed, "status 15");
    EXPECT_FALSE(afterKill.empty()) << "the disconnection was not reported:\n" << printed;
    std::string resumed = From(afterKill, "status 17");
    EXPECT_TRUE(Has(resumed, "value 21.5")) << printed; // the new node's first value
    EXPECT_TRUE(Has(resumed, "value 77")) << printed;

    first.Stop();
    EXPECT_TRUE(WaitForNoServerProcess(20000));
}

TEST(NodeE2E, TwoServerProcessesSeeOnePublish)
{
    Subscribed first;
    ASSERT_NO_FATAL_FAILURE(first.Start());
    TestSink &sink = first.sink;

    // The server's objects in a process of their own, with their own
    // libraries on the same node: one publish reaches both servers.
    auto second = std::async(std::launch::async, [] {
        std::string output;
        RunAndCapture(L"\"" + BinPath(L"second_server.exe") + L"\" " + kTemperature + L" 40 55", output, 60000);
        return output;
    });
    Sleep(3000);
    std::string out;
    EXPECT_EQ(RunCadroctl(L"publish \\\\.\\proc1\\Setpoints.temperature 55", out), 0) << out;
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasDataChange(calls, 55); }));
    std::string printed = second.get();
    EXPECT_TRUE(Has(printed, "added 0x00000000")) << printed;
    EXPECT_TRUE(Has(printed, "value 55")) << printed;

    first.Stop();
    EXPECT_TRUE(WaitForNoServerProcess(20000));
}

namespace {
const wchar_t kLevel[] = L"\\\\PLANT9\\control\\Boiler.level";

// A TCP port of the loopback address that nothing listens on now.
unsigned short FreePort()
{
    WSADATA data;
    if (WSAStartup(MAKEWORD(2, 2), &data) != 0)
        return 0;
    SOCKET s = socket(AF_INET, SOCK_STREAM, IPPROTO_TCP);
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    int size = sizeof address;
    unsigned short port = 0;
    if (bind(s, reinterpret_cast<sockaddr *>(&address), sizeof address) == 0 &&
        getsockname(s, reinterpret_cast<sockaddr *>(&address), &size) == 0)
        port = ntohs(address.sin_port);
    closesocket(s);
    WSACleanup();
    return port;
}

// Another machine's node, on this one: a node of its own name that serves a
// description to other nodes at a loopback port.
class OtherNode {
public:
    OtherNode(const std::wstring &description, unsigned short port)
        : m_command(L"\"" + BinPath(L"cadronode.exe") + L"\" --name CadroNodeE2E --idle 60 --listen 127.0.0.1:" +
                    std::to_wstring(port) + L" --network \"" + description + L"\"")
    {
    }
    ~OtherNode() { Kill(); }
    OtherNode(const OtherNode &) = delete;
    OtherNode &operator=(const OtherNode &) = delete;

    // Started, and answering its control pipe.
    bool Start()
    {
        m_process.Reset(StartProcess(m_command));
        std::string output;
        for (int i = 0; m_process && i < 100; ++i, Sleep(100))
            if (Cadroctl(L"status", output) == 0)
                return true;
        return false;
    }
    long Cadroctl(const std::wstring &arguments, std::string &output)
    {
        return RunAndCapture(L"\"" + BinPath(L"cadroctl.exe") + L"\" --pid " +
                                 std::to_wstring(GetProcessId(m_process.Get())) + L" " + arguments,
                             output);
    }
    void Kill()
    {
        if (!m_process)
            return;
        TerminateProcess(m_process.Get(), 9);
        WaitForSingleObject(m_process.Get(), 10000);
        m_process.Reset();
    }

private:
    std::wstring m_command;
    UniqueHandle m_process;
};
} // namespace

TEST(NodeE2E, AMachineServedByAnotherNodeIsReachedOverTcp)
{
    unsigned short port = FreePort();
    ASSERT_NE(port, 0);
    std::string at = "127.0.0.1:" + std::to_string(port);
    // The other node names a machine at its own address, as this one does:
    // a request for it must be refused, not sent round for ever.
    TestNetwork plant9(L"plant9_network.txt", "machine PLANT9\nprocess control\nobject Boiler\n"
                                              "member level type=number access=rw value=5\n"
                                              "machine LOOP node=" +
                                                  at + "\n");
    TestNetwork here(L"here_network.txt", "machine $HOST\nprocess proc1\nobject Setpoints\n"
                                          "member temperature type=number access=rw value=21.5\n"
                                          "machine PLANT9 node=" +
                                              at + "\nmachine LOOP node=" + at + "\n");
    ASSERT_TRUE(plant9.Ok() && here.Ok());
    OtherNode other(plant9.Path(), port);
    ASSERT_TRUE(other.Start());

    Subscribed first;
    ASSERT_NO_FATAL_FAILURE(first.Create());
    ASSERT_EQ(here.Load(), 0);
    ASSERT_NO_FATAL_FAILURE(first.Add(kLevel, 5));
    TestSink &sink = first.sink;
    // Subscribed (and connected through this node to the other) before
    // anything happens there.
    std::future<std::string> client;
    ASSERT_TRUE(StartNodeClient(kLevel, 50, 77, client));

    // Published there, seen here; written here, stored there.
    std::string out;
    EXPECT_EQ(other.Cadroctl(std::wstring(L"publish ") + kLevel + L" 6", out), 0) << out;
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasDataChange(calls, 6); }));
    ComPtr<IOPCSyncIO> io;
    ASSERT_EQ(first.items.As(io), S_OK);
    VARIANT seven;
    seven.vt = VT_R8;
    seven.dblVal = 7;
    HRESULT *errors = nullptr;
    EXPECT_EQ(io->Write(1, &first.item, &seven, &errors), S_OK);
    CoTaskMemFree(errors);
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasDataChange(calls, 7); }));
    EXPECT_EQ(other.Cadroctl(std::wstring(L"show ") + kLevel, out), 0) << out;
    EXPECT_TRUE(Has(out, "value 7")) << out;
    EXPECT_NE(RunCadroctl(std::wstring(L"show ") + kLevel, out), 0);
    EXPECT_TRUE(Has(out, "served by the node at " + at)) << out;

    OPCITEMDEF loop = {};
    loop.szItemID = const_cast<wchar_t *>(L"\\\\LOOP\\control\\Boiler.level");
    OPCITEMRESULT *results = nullptr;
    errors = nullptr;
    EXPECT_EQ(first.items->AddItems(1, &loop, &results, &errors), S_FALSE);
    EXPECT_EQ(errors ? errors[0] : S_OK, static_cast<HRESULT>(0xC0040007)) << "OPC_E_UNKNOWNITEMID";
    CoTaskMemFree(results);
    CoTaskMemFree(errors);

    // The other node dies and comes back: the subscriptions hear of it and
    // resume on the new one (the published value proves it).
    other.Kill();
    ASSERT_TRUE(other.Start());
    bool resumed = false;
    for (int i = 0; i < 20 && !resumed; ++i) {
        other.Cadroctl(std::wstring(L"publish ") + kLevel + L" 77", out);
        resumed = sink.WaitFor([](auto &calls) { return HasDataChange(calls, 77); }, 500);
    }
    EXPECT_TRUE(resumed);
    std::string printed = client.get();
    std::string afterKill = From(printed, "status 15");
    EXPECT_FALSE(afterKill.empty()) << "the disconnection was not reported:\n" << printed;
    EXPECT_TRUE(Has(From(afterKill, "status 17"), "value 77")) << printed;

    first.Stop();
    EXPECT_TRUE(WaitForNoServerProcess(20000));
}

TEST(NodeE2E, ItemsOfOneUrlInOneServerShareOneSubscriptionOnTheNode)
{
    Subscribed first;
    ASSERT_NO_FATAL_FAILURE(first.Start());
    TestSink &sink = first.sink;
    // A second item of the URL joins the running subscription: it is told
    // the value at once, as a subscription of its own would be.
    OPCHANDLE second = first.More(kTemperature, 2);
    ASSERT_NE(second, 0u);
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasValueFor(calls, 2, 21.5); }));
    std::string out;
    EXPECT_EQ(RunCadroctl(L"show \\\\.\\proc1\\Setpoints.temperature", out), 0) << out;
    EXPECT_TRUE(Has(out, "subscriptions 1")) << out;

    // A publish reaches both; with the first item gone, the second still.
    EXPECT_EQ(RunCadroctl(L"publish \\\\.\\proc1\\Setpoints.temperature 33", out), 0) << out;
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasValueFor(calls, 0, 33) && HasValueFor(calls, 2, 33); }));
    HRESULT *errors = nullptr;
    EXPECT_EQ(first.items->RemoveItems(1, &first.item, &errors), S_OK);
    CoTaskMemFree(errors);
    EXPECT_EQ(RunCadroctl(L"publish \\\\.\\proc1\\Setpoints.temperature 34", out), 0) << out;
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasValueFor(calls, 2, 34); }));

    // A machine that goes away and comes back: the shared subscription's
    // items get the value again; a newcomer while it is away gets none
    // until it is back.
    EXPECT_EQ(RunCadroctl(L"disconnect .", out), 0) << out;
    OPCHANDLE third = first.More(kTemperature, 3);
    ASSERT_NE(third, 0u);
    Sleep(300);
    EXPECT_FALSE(HasValueFor(sink.Snapshot(), 3, 34));
    EXPECT_EQ(RunCadroctl(L"reconnect .", out), 0) << out;
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasValueFor(calls, 3, 34); }));

    // A network loaded since: a new item subscribes to its member, not to
    // the one the running subscription holds.
    EXPECT_EQ(RunCadroctl(L"reset", out), 0) << out;
    OPCHANDLE fourth = first.More(kTemperature, 4);
    ASSERT_NE(fourth, 0u);
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasValueFor(calls, 4, 21.5); }));
    EXPECT_EQ(RunCadroctl(L"publish \\\\.\\proc1\\Setpoints.temperature 35", out), 0) << out;
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasValueFor(calls, 4, 35); }));

    first.Stop();
    EXPECT_TRUE(WaitForNoServerProcess(20000));
}

TEST(NodeE2E, MembersNothingListedAreSubscribedAtOnceAndUnknownOnesStillFail)
{
    // Ten thousand members that no listing named: the library subscribes to
    // them one after another, as AddItems does, and each gets its value.
    std::string text = "machine $HOST\nprocess bulk\nobject o\n";
    for (int i = 0; i < 10000; ++i)
        text += "member m" + std::to_string(i) + " value=" + std::to_string(i) + "\n";
    TestNetwork network(L"bulk_network.txt", text);
    ASSERT_TRUE(network.Ok());
    ASSERT_EQ(network.Load(), 0);
    std::string out;
    RunAndCapture(L"\"" + BinPath(L"node_client.exe") + L"\" --many \\\\.\\bulk\\o 10000 120", out, 180000);
    EXPECT_TRUE(Has(out, "subscribed 10000 failed 0")) << out;
    EXPECT_TRUE(Has(out, "first values 10000")) << out;
    EXPECT_TRUE(Has(out, "wrong values 0")) << out;

    // Nine subscriptions of one process to one member share the library's
    // feed: with the oldest, the middle and the newest let go, then two of
    // their neighbours, a value written reaches exactly the four others,
    // and a tenth joins with it.
    RunAndCapture(L"\"" + BinPath(L"node_client.exe") + L"\" --shared \\\\.\\bulk\\o.m5 9", out, 120000);
    EXPECT_TRUE(Has(out, "shared kept 4/4 released-with-value 0 newcomer yes")) << out;
    // Each receiver is called for its own subscriptions; the library keeps
    // 256 at a time, and a place that comes free serves another.
    RunAndCapture(L"\"" + BinPath(L"node_client.exe") + L"\" --receivers \\\\.\\bulk\\o.m6", out, 120000);
    EXPECT_TRUE(Has(out, "receivers subscribed 256 refused 1 valued 256 again yes")) << out;

    // What the node does not have is refused at once, as before, however
    // close its name is to members it has: a process's name is exact.
    for (const wchar_t *url : {L"\\\\.\\bulk\\o.m10000", L"\\\\.\\BULK\\o.m1", L"\\\\.\\bulk\\o.m1.x"}) {
        RunAndCapture(L"\"" + BinPath(L"node_client.exe") + L"\" " + url + L" 0", out, 60000);
        EXPECT_TRUE(Has(out, "subscribed 0x80070490")) << out;
    }
    // The machine's name in any case, or "." for this machine: the member.
    wchar_t host[MAX_COMPUTERNAME_LENGTH + 1];
    DWORD size = MAX_COMPUTERNAME_LENGTH + 1;
    ASSERT_TRUE(GetComputerNameW(host, &size));
    std::wstring lower(host), upper(host);
    for (size_t i = 0; i < lower.size(); ++i) {
        lower[i] = towlower(lower[i]);
        upper[i] = towupper(upper[i]);
    }
    for (const std::wstring &machine : {std::wstring(L"."), lower, upper}) {
        RunAndCapture(L"\"" + BinPath(L"node_client.exe") + L"\" \\\\" + machine + L"\\bulk\\o.m7 20 7", out, 60000);
        EXPECT_TRUE(Has(out, "subscribed 0x00000000")) << out;
        EXPECT_TRUE(Has(out, "value 7 ")) << out;
    }
}

TEST(NodeE2E, AComputedMemberSubscribedAgainAfterTenIdleSecondsIsCurrent)
{
    const std::wstring sine = L"\\\\.\\proc1\\Waveform.sine";
    std::string out;
    RunAndCapture(L"\"" + BinPath(L"node_client.exe") + L"\" " + sine + L" 2", out, 60000);
    ASSERT_TRUE(Has(out, "value ")) << out;
    Sleep(10500); // nobody subscribes: the node computes nothing for it
    RunAndCapture(L"\"" + BinPath(L"node_client.exe") + L"\" " + sine + L" 1", out, 60000);
    // The first value was computed when it was subscribed again: its time
    // stamp is that of then, not of ten seconds before.
    size_t at = out.find("value ");
    ASSERT_NE(at, std::string::npos) << out;
    size_t age = out.find(" age ", at);
    ASSERT_NE(age, std::string::npos) << out;
    EXPECT_LT(atoll(out.c_str() + age + 5), 5000) << out;
}

// The network node seen from outside: values outlive the processes that
// wrote them, several processes (two servers among them) share one network,
// and a node that dies is reported to every subscription and started again,
// which then resume.
#include "ChildProcess.h"
#include "ComPtr.h"
#include "Handle.h"
#include "OpcRunner.h"
#include "ServerProcess.h"
#include "TestSink.h"
#include "opcda.h"

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
std::string From(const std::string &text, const std::string &from)
{
    size_t at = text.find(from);
    return at == std::string::npos ? std::string() : text.substr(at);
}

// The server COM starts, with an active group whose sink has seen the
// described value of kTemperature.
struct Subscribed {
    void Start()
    {
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
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
        def.szItemID = const_cast<wchar_t *>(kTemperature);
        def.bActive = TRUE;
        OPCITEMRESULT *results = nullptr;
        HRESULT *errors = nullptr;
        ASSERT_EQ(items->AddItems(1, &def, &results, &errors), S_OK);
        CoTaskMemFree(results);
        CoTaskMemFree(errors);
        ASSERT_TRUE(sink.WaitFor([](auto &calls) { return HasDataChange(calls, 21.5); }));
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

    // A second process on the same node, printing what it is told.
    auto other = std::async(std::launch::async, [] {
        std::string output;
        RunAndCapture(L"\"" + BinPath(L"node_client.exe") + L"\" " + kTemperature + L" 40 77", output, 60000);
        return output;
    });
    Sleep(2000);
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
    EXPECT_TRUE(sink.WaitFor([](auto &calls) { return HasDataChange(calls, 77); }));

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

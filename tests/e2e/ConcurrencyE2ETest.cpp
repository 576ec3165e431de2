// Several client processes at once, and clients that call the server from
// inside their callbacks while another of their threads removes the group.
#include "ChildProcess.h"
#include "ComPtr.h"
#include "Handle.h"
#include "OpcErrors.h"
#include "ServerLifetime.h"
#include "ServerProcess.h"
#include "TestAdviseSink.h"
#include "TestProgress.h"
#include "TestSink.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <ocidl.h>

#include <atomic>
#include <cstdio>
#include <string>
#include <thread>
#include <vector>

namespace {
constexpr DWORD kClientTimeoutMs = 90000;
const CServerLifetime::Timing kServerTiming;
// An idle server's whole way out: grace, drain and a bounded exit.
const DWORD kServerExitMs = kServerTiming.graceMs + kServerTiming.drainMs + 20000;

// Starts one activation_client per delay, all released by one event, and
// returns what each printed ("ok ..." or "fail ...").
std::vector<std::string> RunClients(const std::vector<DWORD> &delaysMs)
{
    static int round = 0;
    std::wstring eventName =
        L"concurrency_e2e_" + std::to_wstring(GetCurrentProcessId()) + L"_" + std::to_wstring(++round);
    UniqueHandle go(CreateEventW(nullptr, TRUE, FALSE, eventName.c_str()));
    std::vector<std::string> outputs(delaysMs.size());
    std::vector<std::thread> threads;
    for (size_t i = 0; i < delaysMs.size(); ++i)
        threads.emplace_back([&, i] {
            // Wine's COM runtime in a server process started at the same
            // moment as another now and then faults while it serves a
            // client's first call (activation_client.cpp): the client tries
            // once more, as a real one must, and says so.
            long code = RunAndCapture(L"\"" + BinPath(L"activation_client.exe") + L"\" --event " + eventName +
                                          L" --delay " + std::to_wstring(delaysMs[i]) + L" --retry-platform-fault",
                                      outputs[i], kClientTimeoutMs);
            if (code == -1)
                outputs[i] = "hung";
        });
    Sleep(500); // every client is waiting for the event
    SetEvent(go.Get());
    for (auto &t : threads)
        t.join();
    return outputs;
}

void ExpectAllOk(const std::vector<std::string> &outputs, const char *what)
{
    for (size_t i = 0; i < outputs.size(); ++i) {
        EXPECT_EQ(outputs[i].rfind("ok ", 0), 0u) << what << ", client " << i << ": " << outputs[i];
        if (outputs[i].find(" after ") != std::string::npos)
            printf("%s, client %zu: %s", what, i, outputs[i].c_str()); // a retried platform fault, for the log
    }
}

class ConcurrencyE2E : public testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(WaitForNoServerProcess(kServerExitMs)) << "a server of an earlier test"; }
    void TearDown() override
    {
        EXPECT_TRUE(WaitForNoServerProcess(kServerExitMs)) << "a server process outlived its clients";
    }
};
} // namespace

TEST_F(ConcurrencyE2E, ClientsRacingForAStartingServerEachGetIt)
{
    // Every client's activation may start a process of its own; each gets a
    // working server, and the extra processes leave by themselves.
    ExpectAllOk(RunClients({0, 0}), "two at once");
    ASSERT_TRUE(WaitForNoServerProcess(kServerExitMs)) << "an extra server process stayed";
    ExpectAllOk(RunClients({0, 0, 0, 100, 300, 800}), "six within a second");
}

TEST_F(ConcurrencyE2E, ClientsRacingForAStoppingServerEachGetIt)
{
    // A server whose last client has gone waits, registers its class object
    // for one more client, probes the registry and leaves; clients arriving
    // at any of those moments get a server, this one or a new one.
    for (int pass = 0; pass < 2; ++pass) {
        ExpectAllOk(RunClients({0}), "the first client");
        DWORD before = kServerTiming.graceMs - 700 + static_cast<DWORD>(pass) * 400;
        std::vector<DWORD> delays;
        for (DWORD d = 0; d < 6; ++d)
            delays.push_back(before + d * (kServerTiming.drainMs + 1000) / 5);
        ExpectAllOk(RunClients(delays), "six while the server stops");
        ASSERT_TRUE(WaitForNoServerProcess(kServerExitMs));
    }
}

namespace {
// An active 20 ms group of one item that counts every 10 ms: a callback
// whenever it is scanned.
HRESULT AddCountingGroup(IOPCServer *server, const wchar_t *name, OPCHANDLE client, OPCHANDLE &handle,
                         ComPtr<IOPCItemMgt> &items)
{
    DWORD rate = 0;
    HRESULT hr = server->AddGroup(name, TRUE, 20, client, nullptr, nullptr, 0, &handle, &rate, IID_IOPCItemMgt,
                                  reinterpret_cast<IUnknown **>(items.Out()));
    if (FAILED(hr))
        return hr;
    OPCITEMDEF def = {};
    def.szItemID = const_cast<wchar_t *>(L"\\\\.\\proc1\\Counters.fast");
    def.bActive = TRUE;
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    hr = items->AddItems(1, &def, &results, &errors);
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
    return hr;
}

// A client whose data sink calls the server and the group from inside a
// callback, while another of its threads removes the group.
struct ReentrantClient {
    ComPtr<IOPCServer> server;
    ComPtr<IOPCItemMgt> items;
    OPCHANDLE group = 0;
    UniqueHandle entered{CreateEventW(nullptr, TRUE, FALSE, nullptr)};
    UniqueHandle done{CreateEventW(nullptr, TRUE, FALSE, nullptr)};
    std::atomic<bool> armed{false};
    std::atomic<HRESULT> statusResult{E_PENDING}, addResult{E_PENDING}, stateResult{E_PENDING};

    void Create()
    {
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
        ASSERT_EQ(AddCountingGroup(server.Get(), L"reentrant", 1, group, items), S_OK);
    }

    // Inside the first callback after arming: tell the remover, give it
    // time to start waiting, then call the server and the group.
    void InsideCallback()
    {
        if (!armed.exchange(false))
            return;
        SetEvent(entered.Get());
        Sleep(300);
        TestStep("inside the callback: GetStatus");
        OPCSERVERSTATUS *status = nullptr;
        statusResult = server->GetStatus(&status);
        if (status) {
            CoTaskMemFree(status->szVendorInfo);
            CoTaskMemFree(status);
        }
        OPCHANDLE other = 0;
        DWORD rate = 0;
        ComPtr<IUnknown> unknown;
        TestStep("inside the callback: AddGroup");
        addResult =
            server->AddGroup(L"", FALSE, 1000, 2, nullptr, nullptr, 0, &other, &rate, IID_IUnknown, unknown.Out());
        unknown.Reset();
        TestStep("inside the callback: RemoveGroup of the group it added");
        if (other)
            server->RemoveGroup(other, TRUE);
        TestStep("inside the callback: GetState of the group being removed");
        ComPtr<IOPCGroupStateMgt> state;
        if (SUCCEEDED(items.As(state))) {
            DWORD updateRate, lcid;
            BOOL active;
            LPWSTR name = nullptr;
            LONG bias;
            FLOAT deadband;
            OPCHANDLE client, handle;
            stateResult = state->GetState(&updateRate, &active, &name, &bias, &deadband, &lcid, &client, &handle);
            CoTaskMemFree(name);
        }
        TestStep("inside the callback: returning");
        SetEvent(done.Get());
    }

    // Removes the group on a thread of its own; the result, or E_PENDING
    // when the removal has not returned within the time limit.
    HRESULT RemoveFromAnotherThread(BOOL force)
    {
        std::atomic<HRESULT> result{E_PENDING};
        UniqueHandle removed(CreateEventW(nullptr, TRUE, FALSE, nullptr));
        std::thread remover([&] {
            CoInitializeEx(nullptr, COINIT_MULTITHREADED);
            result = server->RemoveGroup(group, force);
            SetEvent(removed.Get());
            CoUninitialize();
        });
        bool returned = WaitForSingleObject(removed.Get(), 60000) == WAIT_OBJECT_0;
        if (returned)
            remover.join();
        else
            remover.detach(); // the test fails; the process ends with it
        return result;
    }
};

// After the removal the server still serves: a new group's callbacks come.
void ExpectServerStillDelivers(IOPCServer *server)
{
    OPCHANDLE handle = 0;
    ComPtr<IOPCItemMgt> items;
    ASSERT_EQ(AddCountingGroup(server, L"after", 3, handle, items), S_OK);
    TestSink sink;
    ComPtr<IConnectionPointContainer> container;
    ComPtr<IConnectionPoint> point;
    DWORD cookie = 0;
    ASSERT_EQ(items.As(container), S_OK);
    ASSERT_EQ(container->FindConnectionPoint(IID_IOPCDataCallback, point.Out()), S_OK);
    ASSERT_EQ(point->Advise(&sink, &cookie), S_OK);
    EXPECT_TRUE(sink.WaitFor([](const std::vector<Callback> &calls) { return calls.size() >= 2; }, 20000))
        << "the server froze";
    point->Unadvise(cookie);
    items.Reset();
    EXPECT_EQ(server->RemoveGroup(handle, TRUE), S_OK);
}
} // namespace

TEST_F(ConcurrencyE2E, ACallbackThatCallsTheServerWhileItsGroupIsRemovedNeverFreezesIt)
{
    for (bool dataObject : {false, true}) {
        for (BOOL force : {FALSE, TRUE}) {
            SCOPED_TRACE(std::string(dataObject ? "IAdviseSink" : "IOPCDataCallback") +
                         (force ? ", forced removal" : ", plain removal"));
            ReentrantClient client;
            TestStep("creating the server and the group");
            client.Create();
            ASSERT_TRUE(client.server);
            TestSink sink;
            TestAdviseSink adviseSink;
            ComPtr<IConnectionPoint> point;
            ComPtr<IDataObject> data;
            DWORD cookie = 0;
            if (!dataObject) {
                sink.onDataChange = [&client] { client.InsideCallback(); };
                ComPtr<IConnectionPointContainer> container;
                ASSERT_EQ(client.items.As(container), S_OK);
                ASSERT_EQ(container->FindConnectionPoint(IID_IOPCDataCallback, point.Out()), S_OK);
                ASSERT_EQ(point->Advise(&sink, &cookie), S_OK);
            } else {
                adviseSink.onData = [&client] { client.InsideCallback(); };
                ASSERT_EQ(client.items.As(data), S_OK);
                FORMATETC format = {static_cast<CLIPFORMAT>(RegisterClipboardFormatA("OPCSTMFORMATDATATIME")), nullptr,
                                    DVASPECT_CONTENT, -1, TYMED_HGLOBAL};
                ASSERT_EQ(data->DAdvise(&format, 0, &adviseSink, &cookie), S_OK);
            }
            client.armed = true;
            TestStep("waiting for a callback");
            ASSERT_EQ(WaitForSingleObject(client.entered.Get(), 20000), WAIT_OBJECT_0) << "no callback came";
            TestStep("removing the group from another thread");
            HRESULT removed = client.RemoveFromAnotherThread(force);
            TestStep("waiting for the callback to return");
            EXPECT_NE(removed, E_PENDING) << "RemoveGroup never returned";
            EXPECT_TRUE(removed == S_OK || removed == OPC_S_INUSE) << std::hex << removed;
            ASSERT_EQ(WaitForSingleObject(client.done.Get(), 60000), WAIT_OBJECT_0) << "the callback never returned";
            EXPECT_EQ(client.statusResult.load(), S_OK) << "GetStatus from inside the callback";
            EXPECT_EQ(client.addResult.load(), S_OK) << "AddGroup from inside the callback";
            HRESULT state = client.stateResult.load();
            EXPECT_TRUE(state == S_OK || state == E_FAIL || state == RPC_E_DISCONNECTED) << std::hex << state;
            TestStep("checking that the server still delivers");
            ExpectServerStillDelivers(client.server.Get());
            TestStep("releasing the client's references");
            point.Reset();
            data.Reset();
            client.items.Reset();
            client.server.Reset();
        }
    }
}

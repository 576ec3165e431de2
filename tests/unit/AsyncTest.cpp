// Subscriptions and DA 2.0 asynchronous I/O in this process, against the
// simulated default network.
#include "ComModule.h"
#include "InProcServer.h"
#include "OPCGroup.h"
#include "OpcErrors.h"
#include "TestSink.h"

#include <olectl.h>

#include <future>
#include <thread>

namespace {
const wchar_t kFast[] = L"\\\\.\\proc1\\Counters.fast";                // a counter every 10 ms
const wchar_t kTemperature[] = L"\\\\.\\proc1\\Setpoints.temperature"; // constant 21.5, rw
const wchar_t kCommand[] = L"\\\\.\\proc1\\Setpoints.command";         // write-only
const wchar_t kNever[] = L"\\\\.\\proc1\\Setpoints.never";             // never delivers

// The reads the network has answered so far (its status).
unsigned long ReadsSoFar()
{
    BSTR answer = nullptr;
    CadroSim_Execute(L"status", &answer);
    std::wstring status = answer ? answer : L"";
    SysFreeString(answer);
    size_t at = status.find(L"\nreads ");
    return at == std::wstring::npos ? 0 : wcstoul(status.c_str() + at + 7, nullptr, 10);
}

class AsyncTest : public testing::Test {
protected:
    void SetUp() override
    {
        ResetNetwork(); // the described values, whatever ran before
        server = CreateInProcServer();
        ASSERT_EQ(server->AddGroup(L"async", TRUE, 50, 777, nullptr, nullptr, 0, &hGroup, &rate, IID_IOPCItemMgt,
                                   reinterpret_cast<IUnknown **>(items.Out())),
                  S_OK);
        ASSERT_EQ(items.As(async), S_OK);
        ASSERT_EQ(items.As(state), S_OK);
        ASSERT_EQ(items.As(container), S_OK);
        ASSERT_EQ(container->FindConnectionPoint(IID_IOPCDataCallback, point.Out()), S_OK);
    }
    void TearDown() override
    {
        if (cookie)
            point->Unadvise(cookie);
        point.Reset();
        container.Reset();
        async.Reset();
        state.Reset();
        items.Reset();
        if (server)
            server->RemoveGroup(hGroup, TRUE);
        server.Reset();
    }
    void Advise() { ASSERT_EQ(point->Advise(&sink, &cookie), S_OK); }
    std::vector<OPCHANDLE> Add(std::vector<const wchar_t *> ids, BOOL active = TRUE)
    {
        std::vector<OPCITEMDEF> defs;
        for (size_t i = 0; i < ids.size(); ++i) {
            OPCITEMDEF d = {};
            d.szItemID = const_cast<wchar_t *>(ids[i]);
            d.bActive = active;
            d.hClient = static_cast<OPCHANDLE>(100 + i);
            defs.push_back(d);
        }
        OPCITEMRESULT *r = nullptr;
        HRESULT *e = nullptr;
        EXPECT_EQ(items->AddItems(static_cast<DWORD>(defs.size()), defs.data(), &r, &e), S_OK);
        std::vector<OPCHANDLE> handles;
        for (size_t i = 0; i < defs.size(); ++i)
            handles.push_back(r ? r[i].hServer : 0);
        CoTaskMemFree(r);
        CoTaskMemFree(e);
        return handles;
    }
    bool GroupActive() { return StateOf(state.Get()).active != FALSE; }

    ComPtr<IOPCServer> server;
    OPCHANDLE hGroup = 0;
    DWORD rate = 0;
    ComPtr<IOPCItemMgt> items;
    ComPtr<IOPCAsyncIO2> async;
    ComPtr<IOPCGroupStateMgt> state;
    ComPtr<IConnectionPointContainer> container;
    ComPtr<IConnectionPoint> point;
    TestSink sink;
    DWORD cookie = 0;
};

bool HasDataChangeWith(const std::vector<Callback> &calls, OPCHANDLE client, DWORD transid)
{
    for (const auto &c : calls)
        if (c.kind == Callback::DataChange && c.transid == transid)
            for (OPCHANDLE h : c.clients)
                if (h == client)
                    return true;
    return false;
}
} // namespace

TEST_F(AsyncTest, SubscriptionsReportOnlyChangedItemsAndFollowTheEnableFlag)
{
    Advise();
    Add({kTemperature, kFast});
    // First scan: both items; afterwards only the counter changes.
    ASSERT_TRUE(sink.WaitFor([](auto &calls) { return HasDataChangeWith(calls, 100, 0); }));
    ASSERT_TRUE(sink.WaitFor([](auto &calls) {
        int fastOnly = 0;
        for (const auto &c : calls)
            fastOnly += c.kind == Callback::DataChange && c.clients == std::vector<OPCHANDLE>{101};
        return fastOnly >= 3;
    }));
    for (const auto &c : sink.Snapshot()) {
        EXPECT_EQ(c.group, 777u);
        EXPECT_EQ(c.transid, 0u);
        EXPECT_EQ(c.masterQuality, S_OK);
        EXPECT_EQ(c.masterError, S_OK);
    }
    OPCSERVERSTATUS *status = nullptr;
    ASSERT_EQ(server->GetStatus(&status), S_OK);
    EXPECT_NE(status->ftLastUpdateTime.dwHighDateTime, 0u) << "a delivered change sets the last update time";
    CoTaskMemFree(status->szVendorInfo);
    CoTaskMemFree(status);

    BOOL enabled = FALSE;
    EXPECT_EQ(async->GetEnable(&enabled), S_OK);
    EXPECT_TRUE(enabled);
    EXPECT_EQ(async->SetEnable(FALSE), S_OK);
    Sleep(150);
    size_t before = sink.Count(Callback::DataChange);
    Sleep(300);
    EXPECT_EQ(sink.Count(Callback::DataChange), before) << "disabled: no subscription changes";
    DWORD cancelId = 0;
    ASSERT_EQ(async->Refresh2(OPC_DS_CACHE, 4242, &cancelId), S_OK);
    EXPECT_NE(cancelId, 0u);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) { return HasDataChangeWith(calls, 100, 4242); }))
        << "a refresh is answered whatever the enable flag";
    EXPECT_EQ(async->GetEnable(nullptr), E_FAIL);
}

TEST_F(AsyncTest, ReadAndWriteCompleteFromTheWorker)
{
    auto h = Add({kTemperature, kCommand});
    DWORD cancelId = 0;
    HRESULT *errors = nullptr;
    OPCHANDLE read[] = {h[0], 0xBAD, h[1]};
    EXPECT_EQ(async->Read(3, read, 1, &cancelId, &errors), CONNECT_E_NOCONNECTION) << "no sink yet";
    EXPECT_EQ(async->Read(0, read, 1, &cancelId, &errors), E_INVALIDARG);
    Advise();
    ASSERT_EQ(async->Read(3, read, 1, &cancelId, &errors), S_FALSE);
    EXPECT_EQ(errors[0], S_OK);
    EXPECT_EQ(errors[1], OPC_E_INVALIDHANDLE);
    EXPECT_EQ(errors[2], OPC_E_BADRIGHTS);
    CoTaskMemFree(errors);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) {
        for (const auto &c : calls)
            if (c.kind == Callback::ReadComplete && c.transid == 1)
                return true;
        return false;
    }));
    for (const auto &c : sink.Snapshot()) {
        if (c.kind != Callback::ReadComplete)
            continue;
        EXPECT_EQ(c.clients, std::vector<OPCHANDLE>{100});
        EXPECT_EQ(c.values[0], 21.5);
        EXPECT_NE(c.thread, GetCurrentThreadId());
    }
    OPCHANDLE bad[] = {0xBAD};
    EXPECT_EQ(async->Read(1, bad, 2, &cancelId, &errors), S_FALSE);
    EXPECT_EQ(cancelId, 0u) << "nothing passed: no transaction";
    CoTaskMemFree(errors);

    VARIANT values[2];
    V_VT(&values[0]) = VT_R8;
    V_R8(&values[0]) = 30.5;
    V_VT(&values[1]) = VT_R8;
    V_R8(&values[1]) = 1;
    ASSERT_EQ(async->Write(2, h.data(), values, 9, &cancelId, &errors), S_OK);
    CoTaskMemFree(errors);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) {
        for (const auto &c : calls)
            if (c.kind == Callback::WriteComplete && c.transid == 9)
                return c.masterError == S_OK && c.clients == std::vector<OPCHANDLE>{100, 101};
        return false;
    }));
    EXPECT_EQ(sink.Count(Callback::CancelComplete), 0u);
}

TEST_F(AsyncTest, CancelDropsQueuedTransactionsWithoutCallbacks)
{
    auto h = Add({kTemperature});
    Advise();
    // The worker is kept busy by a read of another group that waits about
    // 3 s for the member that never delivers: that group's lock is held
    // meanwhile, this one's is free.
    ComPtr<IOPCItemMgt> slowItems;
    OPCHANDLE slowGroup = 0;
    DWORD slowRate = 0;
    ASSERT_EQ(server->AddGroup(L"slow", TRUE, 50, 1, nullptr, nullptr, 0, &slowGroup, &slowRate, IID_IOPCItemMgt,
                               reinterpret_cast<IUnknown **>(slowItems.Out())),
              S_OK);
    OPCITEMDEF def = {};
    def.szItemID = const_cast<wchar_t *>(kNever);
    def.bActive = TRUE;
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    ASSERT_EQ(slowItems->AddItems(1, &def, &results, &errors), S_OK);
    OPCHANDLE never = results[0].hServer;
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
    TestSink slowSink;
    ComPtr<IConnectionPointContainer> slowContainer;
    ComPtr<IConnectionPoint> slowPoint;
    ASSERT_EQ(slowItems.As(slowContainer), S_OK);
    ASSERT_EQ(slowContainer->FindConnectionPoint(IID_IOPCDataCallback, slowPoint.Out()), S_OK);
    DWORD slowCookie = 0;
    ASSERT_EQ(slowPoint->Advise(&slowSink, &slowCookie), S_OK);
    ComPtr<IOPCAsyncIO2> slowAsync;
    ASSERT_EQ(slowItems.As(slowAsync), S_OK);

    DWORD slowId = 0, queuedId = 0;
    unsigned long readsBefore = ReadsSoFar();
    ASSERT_EQ(slowAsync->Read(1, &never, 50, &slowId, &errors), S_OK);
    CoTaskMemFree(errors);
    // The worker must have taken the slow read before the next one comes (a
    // worker that woke late would take both at once): it has once it has
    // asked the network.
    for (int i = 0; i < 1000 && ReadsSoFar() == readsBefore; ++i)
        Sleep(10);
    ASSERT_NE(ReadsSoFar(), readsBefore) << "the worker never read the slow item";
    ASSERT_EQ(async->Read(1, &h[0], 51, &queuedId, &errors), S_OK);
    CoTaskMemFree(errors);
    EXPECT_EQ(slowAsync->Cancel2(queuedId), E_FAIL) << "another group's transaction";
    EXPECT_EQ(async->Cancel2(queuedId), S_OK);
    EXPECT_EQ(async->Cancel2(queuedId), E_FAIL) << "already gone";
    EXPECT_EQ(async->Cancel2(0xFFFFFF), E_FAIL) << "never issued";
    ASSERT_TRUE(slowSink.WaitFor([](auto &calls) {
        for (const auto &c : calls)
            if (c.kind == Callback::ReadComplete && c.transid == 50)
                return true;
        return false;
    }));
    Sleep(100);
    for (const auto &c : sink.Snapshot())
        EXPECT_NE(c.transid, 51u) << "a cancelled read sends nothing";
    for (const auto &c : slowSink.Snapshot())
        if (c.transid == 50) {
            EXPECT_EQ(c.errors, std::vector<HRESULT>{OPC_E_UNKNOWNITEMID});
        }
    EXPECT_EQ(slowAsync->Cancel2(slowId), E_FAIL) << "already completed";
    EXPECT_EQ(sink.Count(Callback::CancelComplete), 0u);
    slowPoint->Unadvise(slowCookie);
    server->RemoveGroup(slowGroup, TRUE);
}

TEST_F(AsyncTest, ConnectionPointRules)
{
    DWORD c2 = 0;
    Advise();
    TestSink other;
    EXPECT_EQ(point->Advise(&other, &c2), CONNECT_E_ADVISELIMIT);
    EXPECT_EQ(c2, 0u);
    EXPECT_EQ(point->Unadvise(cookie + 1), CONNECT_E_NOCONNECTION);
    ComPtr<IEnumConnections> connections;
    ASSERT_EQ(point->EnumConnections(connections.Out()), S_OK);
    CONNECTDATA data = {};
    ASSERT_EQ(connections->Next(1, &data, nullptr), S_OK);
    EXPECT_EQ(data.dwCookie, cookie);
    data.pUnk->Release();
    IID iid;
    EXPECT_EQ(point->GetConnectionInterface(&iid), S_OK);
    EXPECT_TRUE(IsEqualIID(iid, IID_IOPCDataCallback));
    ComPtr<IConnectionPoint> none;
    EXPECT_EQ(container->FindConnectionPoint(IID_IDispatch, none.Out()), CONNECT_E_NOCONNECTION);
    EXPECT_EQ(point->Unadvise(cookie), S_OK);
    cookie = 0;
    EXPECT_EQ(point->Advise(&other, &c2), S_OK) << "free again after Unadvise";
    EXPECT_EQ(point->Unadvise(c2), S_OK);
    EXPECT_EQ(point->Advise(nullptr, &c2), E_POINTER);
    ComPtr<IEnumConnections> empty;
    ASSERT_EQ(point->EnumConnections(empty.Out()), S_OK);
    ULONG fetched = 7;
    EXPECT_EQ(empty->Next(1, &data, &fetched), S_FALSE) << "without a sink the enumerator just runs out";
    EXPECT_EQ(fetched, 0u);
    EXPECT_EQ(async->SetEnable(TRUE), CONNECT_E_NOCONNECTION);
    EXPECT_EQ(other.Refs(), 1u) << "the group released the sink";

    Advise();
    DWORD cancelId;
    EXPECT_EQ(async->Refresh2(static_cast<OPCDATASOURCE>(3), 1, &cancelId), E_INVALIDARG);
    EXPECT_EQ(async->Refresh2(OPC_DS_CACHE, 1, &cancelId), E_FAIL) << "an active group without active items";
    Add({kTemperature}, FALSE);
    EXPECT_EQ(async->Refresh2(OPC_DS_CACHE, 1, &cancelId), E_FAIL);

    // One point object, whichever way it is reached, part of its group.
    ComPtr<IConnectionPoint> again;
    ASSERT_EQ(container->FindConnectionPoint(IID_IOPCDataCallback, again.Out()), S_OK);
    EXPECT_EQ(again.Get(), point.Get());
    ComPtr<IEnumConnectionPoints> points;
    ASSERT_EQ(container->EnumConnectionPoints(points.Out()), S_OK);
    IConnectionPoint *listed = nullptr;
    ASSERT_EQ(points->Next(1, &listed, nullptr), S_OK);
    EXPECT_EQ(listed, point.Get());
    listed->Release();
    ComPtr<IConnectionPointContainer> back;
    ASSERT_EQ(point->GetConnectionPointContainer(back.Out()), S_OK);
    EXPECT_EQ(back.Get(), container.Get());

    // A group whose removal has begun takes no new sink.
    EXPECT_EQ(point->Unadvise(cookie), S_OK);
    cookie = 0;
    ASSERT_EQ(server->RemoveGroup(hGroup, FALSE), OPC_S_INUSE);
    hGroup = 0;
    EXPECT_EQ(point->Advise(&other, &c2), E_FAIL);
    EXPECT_EQ(c2, 0u);
    EXPECT_EQ(other.Refs(), 1u);
}

TEST_F(AsyncTest, ThreeFailedDeliveriesMakeTheGroupInactive)
{
    sink.dataChangeResult = E_FAIL;
    Advise();
    Add({kFast});
    ASSERT_TRUE(sink.WaitFor([](auto &calls) { return calls.size() >= 3; }));
    for (int i = 0; i < 100 && GroupActive(); ++i)
        Sleep(20);
    EXPECT_FALSE(GroupActive());
    Sleep(200);
    size_t after = sink.Count(Callback::DataChange);
    Sleep(200);
    EXPECT_EQ(sink.Count(Callback::DataChange), after);
}

TEST_F(AsyncTest, RemovalFromAnotherThreadWaitsForTheCallbackInProgress)
{
    // RemoveGroup returns only once the scan inside OnDataChange has let go
    // of the group, and then answers S_OK: nothing but the scanner held it.
    std::promise<void> inCallback;
    std::promise<void> goOn;
    std::shared_future<void> goOnFuture = goOn.get_future().share();
    std::atomic<bool> first{true};
    sink.onDataChange = [&] {
        if (first.exchange(false)) {
            inCallback.set_value();
            goOnFuture.wait();
        }
    };
    Advise();
    Add({kFast});
    ASSERT_EQ(inCallback.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);
    cookie = 0; // the sink goes with the group
    point.Reset();
    container.Reset();
    async.Reset();
    state.Reset();
    items.Reset();
    auto remover = std::async(std::launch::async, [&] {
        CoInitializeEx(nullptr, COINIT_MULTITHREADED);
        HRESULT hr = server->RemoveGroup(hGroup, FALSE);
        CoUninitialize();
        return hr;
    });
    EXPECT_EQ(remover.wait_for(std::chrono::milliseconds(300)), std::future_status::timeout)
        << "RemoveGroup returned while the group's callback was still running";
    goOn.set_value();
    ASSERT_EQ(remover.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    EXPECT_EQ(remover.get(), S_OK);
    size_t after = sink.Count(Callback::DataChange);
    Sleep(200);
    EXPECT_EQ(sink.Count(Callback::DataChange), after) << "a data change after RemoveGroup returned";
    hGroup = 0;
}

TEST_F(AsyncTest, AGroupRemovedInsideItsCallbackNeverReachesItsOwnerAgain)
{
    // A client removes the group from inside its callback (the scan still
    // holds the group) and may then release the server: when the callback
    // returns, the scan must not reach the owner. An owner that records
    // calls stands in for the server object that would be gone.
    class Owner : public CGroupOwner {
    public:
        IOPCServer *OwnerServer() override { return nullptr; }
        CGroupRegistry &Registry() override { return registry; }
        bool EnterGroupCall() override
        {
            callsAfterRemoval += removed ? 1 : 0;
            return true;
        }
        void LeaveGroupCall() override {}
        void SetLastUpdateTime(const FILETIME &) override {}
        CGroupRegistry registry;
        std::atomic<bool> removed{false};
        std::atomic<int> callsAfterRemoval{0};
    } owner;
    static_cast<COPCGroup *>(state.Get())->SetOwner(&owner);
    std::atomic<bool> first{true};
    std::promise<HRESULT> removed;
    sink.onDataChange = [&] {
        if (!first.exchange(false))
            return;
        HRESULT hr = server->RemoveGroup(hGroup, FALSE);
        owner.removed = true;
        removed.set_value(hr);
    };
    Advise();
    Add({kFast});
    auto f = removed.get_future();
    ASSERT_EQ(f.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    EXPECT_EQ(f.get(), OPC_S_INUSE);
    hGroup = 0;
    Sleep(300); // the scan returns from the callback and ends
    EXPECT_EQ(owner.callsAfterRemoval, 0);
}

TEST_F(AsyncTest, ASinkUnadvisedInsideItsCallbackIsReleasedOutsideTheGroupLock)
{
    // The last release of a sink may call back into the server (or block on
    // the client's side): it must never run under the group lock, here
    // shown by another thread that must get through to the group meanwhile.
    class ProbingSink : public TestSink {
    public:
        STDMETHODIMP_(ULONG) Release() override
        {
            ULONG refs = TestSink::Release();
            if (refs == 1 && group) {
                reader = std::async(std::launch::async, [this] {
                    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
                    BOOL enabled;
                    group->GetEnable(&enabled);
                    CoUninitialize();
                });
                lockFree = reader.wait_for(std::chrono::seconds(2)) == std::future_status::ready;
                released = true;
            }
            return refs;
        }
        IOPCAsyncIO2 *group = nullptr;
        std::future<void> reader; // ends once the group lock is free
        std::atomic<bool> released{false};
        std::atomic<bool> lockFree{false};
    } probing;
    probing.group = async.Get();
    probing.dataChangeResult = E_FAIL; // the scan then ends under its lock
    ASSERT_EQ(point->Advise(&probing, &cookie), S_OK);
    std::atomic<bool> first{true};
    probing.onDataChange = [&] {
        if (first.exchange(false)) {
            EXPECT_EQ(point->Unadvise(cookie), S_OK);
        }
    };
    Add({kFast});
    for (int i = 0; i < 500 && !probing.released; ++i)
        Sleep(10);
    cookie = 0;
    EXPECT_TRUE(probing.released);
    EXPECT_TRUE(probing.lockFree) << "the sink was released under the group lock";
    probing.group = nullptr;
}

TEST_F(AsyncTest, AClientMayRemoveItsGroupFromInsideItsOwnCallback)
{
    std::promise<HRESULT> result;
    std::atomic<bool> first{true};
    sink.onDataChange = [&] {
        if (first.exchange(false))
            result.set_value(server->RemoveGroup(hGroup, TRUE));
    };
    Advise();
    Add({kFast});
    auto f = result.get_future();
    ASSERT_EQ(f.wait_for(std::chrono::seconds(10)), std::future_status::ready)
        << "the removal inside the callback did not return";
    EXPECT_EQ(f.get(), S_OK);
    hGroup = 0;
    cookie = 0; // the group went with its sink
    Sleep(200);
    size_t after = sink.Count(Callback::DataChange);
    Sleep(200);
    EXPECT_EQ(sink.Count(Callback::DataChange), after) << "a removed group is not scanned";
}

TEST_F(AsyncTest, TogglesAndRateChangesFromManyThreadsWhileScansRun)
{
    Advise();
    auto h = Add({kFast, kTemperature});
    std::atomic<bool> stop{false};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            CoInitializeEx(nullptr, COINIT_MULTITHREADED);
            for (int i = 0; !stop; ++i) {
                DWORD requested = 10 + (i % 7) * 5, revised;
                BOOL active = (i + t) % 3 != 0;
                state->SetState(&requested, &revised, &active, nullptr, nullptr, nullptr, nullptr);
                HRESULT *errors = nullptr;
                items->SetActiveState(1, &h[t % 2], i % 2, &errors);
                CoTaskMemFree(errors);
                DWORD cancel = 0;
                if (SUCCEEDED(async->Read(2, h.data(), i, &cancel, &errors)) && i % 3 == 0)
                    async->Cancel2(cancel);
                CoTaskMemFree(errors);
            }
            CoUninitialize();
        });
    }
    Sleep(1500);
    stop = true;
    for (auto &t : threads)
        t.join();
    // Still working: an active group reports its items again.
    BOOL active = TRUE;
    DWORD requested = 10, revised;
    EXPECT_EQ(state->SetState(&requested, &revised, &active, nullptr, nullptr, nullptr, nullptr), S_OK);
    size_t before = sink.Count(Callback::DataChange);
    EXPECT_TRUE(sink.WaitFor([before](auto &calls) { return calls.size() > before + 3; }));
}

TEST(AsyncShutdown, ThousandsOfQueuedTransactionsAtReleaseNeitherHangNorLeak)
{
    LONG locks = ComModule::LockCount();
    TestSink sink;
    auto server = CreateInProcServer();
    auto makeGroup = [&](const wchar_t *item, ComPtr<IOPCAsyncIO2> &async, OPCHANDLE &h) {
        OPCHANDLE hGroup;
        DWORD rate;
        ComPtr<IOPCItemMgt> items;
        ASSERT_EQ(server->AddGroup(L"", TRUE, 1000, 0, nullptr, nullptr, 0, &hGroup, &rate, IID_IOPCItemMgt,
                                   reinterpret_cast<IUnknown **>(items.Out())),
                  S_OK);
        items.As(async);
        ComPtr<IConnectionPointContainer> container;
        items.As(container);
        ComPtr<IConnectionPoint> point;
        container->FindConnectionPoint(IID_IOPCDataCallback, point.Out());
        DWORD cookie;
        ASSERT_EQ(point->Advise(&sink, &cookie), S_OK);
        OPCITEMDEF def = {};
        def.szItemID = const_cast<wchar_t *>(item);
        OPCITEMRESULT *r = nullptr;
        HRESULT *e = nullptr;
        ASSERT_EQ(items->AddItems(1, &def, &r, &e), S_OK);
        h = r[0].hServer;
        CoTaskMemFree(r);
        CoTaskMemFree(e);
    };
    ComPtr<IOPCAsyncIO2> blocker, busy;
    OPCHANDLE hNever = 0, hTemperature = 0;
    makeGroup(kNever, blocker, hNever);
    makeGroup(kTemperature, busy, hTemperature);
    DWORD cancel;
    HRESULT *e = nullptr;
    ASSERT_EQ(blocker->Read(1, &hNever, 1, &cancel, &e), S_OK); // the worker waits about 3 s
    CoTaskMemFree(e);
    for (int i = 0; i < 5000; ++i) {
        ASSERT_EQ(busy->Read(1, &hTemperature, i, &cancel, &e), S_OK);
        CoTaskMemFree(e);
    }
    blocker.Reset();
    busy.Reset();
    // The release removes the groups, which waits for their transactions.
    auto release = std::async(std::launch::async, [&] {
        CoInitializeEx(nullptr, COINIT_MULTITHREADED);
        server.Reset();
        CoUninitialize();
    });
    ASSERT_EQ(release.wait_for(std::chrono::seconds(60)), std::future_status::ready);
    EXPECT_EQ(ComModule::LockCount(), locks) << "every group and transaction was released";
}

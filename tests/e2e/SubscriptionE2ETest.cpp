// DA 2.0 subscriptions across the process boundary: the sink lives in this
// process, the server calls it back while cadroctl publishes values.
#include "ComPtr.h"
#include "GroupState.h"
#include "OpcErrors.h"
#include "ServerProcess.h"
#include "TestSink.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <cmath>
#include <future>
#include <ocidl.h>
#include <olectl.h>

namespace {
const wchar_t kTemperature[] = L"\\\\.\\proc1\\Setpoints.temperature";

bool HasValue(const std::vector<Callback> &calls, Callback::Kind kind, DWORD transid, double value)
{
    for (const auto &c : calls)
        if (c.kind == kind && c.transid == transid)
            for (double v : c.values)
                if (v == value)
                    return true;
    return false;
}

class SubscriptionE2E : public testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(WaitForNoServerProcess(20000));
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
        DWORD rate;
        ASSERT_EQ(server->AddGroup(L"sub", TRUE, 100, 55, nullptr, nullptr, 0, &hGroup, &rate, IID_IOPCItemMgt,
                                   reinterpret_cast<IUnknown **>(items.Out())),
                  S_OK);
        ASSERT_EQ(items.As(async), S_OK);
        ASSERT_EQ(items.As(state), S_OK);
        ComPtr<IConnectionPointContainer> container;
        ASSERT_EQ(items.As(container), S_OK);
        ASSERT_EQ(container->FindConnectionPoint(IID_IOPCDataCallback, point.Out()), S_OK);
        ASSERT_EQ(point->Advise(&sink, &cookie), S_OK);
    }
    void TearDown() override
    {
        point.Reset();
        async.Reset();
        state.Reset();
        items.Reset();
        server.Reset();
        EXPECT_TRUE(WaitForNoServerProcess(20000)) << "the server did not exit";
        CoDisconnectObject(&sink, 0); // no late call may reach the sink
    }
    OPCHANDLE Add(const wchar_t *id, OPCHANDLE client)
    {
        OPCITEMDEF d = {};
        d.szItemID = const_cast<wchar_t *>(id);
        d.bActive = TRUE;
        d.hClient = client;
        OPCITEMRESULT *r = nullptr;
        HRESULT *e = nullptr;
        EXPECT_EQ(items->AddItems(1, &d, &r, &e), S_OK);
        OPCHANDLE h = r ? r[0].hServer : 0;
        CoTaskMemFree(r);
        CoTaskMemFree(e);
        return h;
    }
    long Publish(const std::wstring &args)
    {
        std::string out;
        return RunCadroctl(L"publish " + args, out);
    }

    ComPtr<IOPCServer> server;
    OPCHANDLE hGroup = 0;
    ComPtr<IOPCItemMgt> items;
    ComPtr<IOPCAsyncIO2> async;
    ComPtr<IOPCGroupStateMgt> state;
    ComPtr<IConnectionPoint> point;
    TestSink sink;
    DWORD cookie = 0;
};
} // namespace

TEST_F(SubscriptionE2E, DataChangesArriveWhilePublishedAndStopWhenDisabled)
{
    OPCHANDLE h = Add(kTemperature, 7);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) { return HasValue(calls, Callback::DataChange, 0, 21.5); }));
    EXPECT_EQ(Publish(std::wstring(kTemperature) + L" 55"), 0);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) { return HasValue(calls, Callback::DataChange, 0, 55); }));
    for (const auto &c : sink.Snapshot()) {
        EXPECT_EQ(c.group, 55u);
        EXPECT_EQ(c.clients, std::vector<OPCHANDLE>{7});
    }
    EXPECT_EQ(Publish(std::wstring(kTemperature) + L" 56 quality=bad"), 0);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) {
        for (const auto &c : calls)
            if (c.kind == Callback::DataChange && !c.values.empty() && c.values[0] == 56)
                return c.masterQuality == S_FALSE && c.qualities[0] == OPC_QUALITY_BAD;
        return false;
    }));

    ASSERT_EQ(async->SetEnable(FALSE), S_OK);
    EXPECT_EQ(Publish(std::wstring(kTemperature) + L" 66"), 0);
    Sleep(600);
    EXPECT_FALSE(HasValue(sink.Snapshot(), Callback::DataChange, 0, 66)) << "disabled";
    DWORD cancelId = 0;
    ASSERT_EQ(async->Refresh2(OPC_DS_CACHE, 31, &cancelId), S_OK);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) { return HasValue(calls, Callback::DataChange, 31, 66); }));

    // Read and write completions come from the server's worker.
    HRESULT *errors = nullptr;
    ASSERT_EQ(async->Read(1, &h, 41, &cancelId, &errors), S_OK);
    CoTaskMemFree(errors);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) { return HasValue(calls, Callback::ReadComplete, 41, 66); }));
    VARIANT v;
    V_VT(&v) = VT_R8;
    V_R8(&v) = 12.25;
    ASSERT_EQ(async->Write(1, &h, &v, 42, &cancelId, &errors), S_OK);
    CoTaskMemFree(errors);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) {
        for (const auto &c : calls)
            if (c.kind == Callback::WriteComplete && c.transid == 42)
                return c.errors == std::vector<HRESULT>{S_OK};
        return false;
    }));
}

TEST_F(SubscriptionE2E, CancelledReadsSendNothingAndFailingSinksDeactivateTheGroup)
{
    OPCHANDLE t = Add(kTemperature, 2);
    // The worker is held inside the first completion, so the second request
    // is still queued when it is cancelled.
    std::promise<void> inFirst, cancelled;
    std::shared_future<void> cancelledFuture = cancelled.get_future().share();
    sink.onReadComplete = [&](DWORD transid) {
        if (transid == 60) {
            inFirst.set_value();
            cancelledFuture.wait_for(std::chrono::seconds(20));
        }
    };
    DWORD slow = 0, queued = 0;
    HRESULT *errors = nullptr;
    ASSERT_EQ(async->Read(1, &t, 60, &slow, &errors), S_OK);
    CoTaskMemFree(errors);
    ASSERT_EQ(inFirst.get_future().wait_for(std::chrono::seconds(20)), std::future_status::ready);
    ASSERT_EQ(async->Read(1, &t, 61, &queued, &errors), S_OK);
    CoTaskMemFree(errors);
    EXPECT_EQ(async->Cancel2(queued), S_OK);
    cancelled.set_value();
    ASSERT_TRUE(sink.WaitFor([](auto &calls) {
        for (const auto &c : calls)
            if (c.kind == Callback::ReadComplete && c.transid == 60)
                return true;
        return false;
    }));
    for (const auto &c : sink.Snapshot())
        EXPECT_NE(c.transid, 61u);
    EXPECT_EQ(sink.Count(Callback::CancelComplete), 0u);

    // A client whose callback fails three times in a row finds its group
    // inactive: an item that changes at every scan makes every scan deliver.
    sink.dataChangeResult = E_FAIL;
    Add(L"\\\\.\\proc1\\Counters.fast", 3);
    bool active = true;
    for (int i = 0; i < 200 && active; ++i, Sleep(50))
        active = StateOf(state.Get()).active != FALSE;
    EXPECT_FALSE(active);
}

TEST_F(SubscriptionE2E, RemovalWaitsForARunningCallbackUnlessMadeFromInsideIt)
{
    // From inside the group's own OnDataChange: the call arrives on another
    // server thread but carries the callback's logical thread, so it must
    // not wait for the callback that waits for it.
    const wchar_t kFast[] = L"\\\\.\\proc1\\Counters.fast";
    std::promise<HRESULT> inside;
    std::atomic<bool> first{true};
    sink.onDataChange = [&] {
        if (first.exchange(false))
            inside.set_value(server->RemoveGroup(hGroup, FALSE));
    };
    Add(kFast, 1);
    auto f = inside.get_future();
    ASSERT_EQ(f.wait_for(std::chrono::seconds(20)), std::future_status::ready)
        << "the removal inside the callback waited for that callback";
    EXPECT_EQ(f.get(), OPC_S_INUSE) << "this client still holds the group";

    // From another thread: RemoveGroup returns only after the callback has
    // returned, and no data change follows it.
    DWORD rate;
    OPCHANDLE second = 0;
    ComPtr<IOPCItemMgt> other;
    ASSERT_EQ(server->AddGroup(L"other", TRUE, 100, 56, nullptr, nullptr, 0, &second, &rate, IID_IOPCItemMgt,
                               reinterpret_cast<IUnknown **>(other.Out())),
              S_OK);
    TestSink slow;
    std::promise<void> inCallback;
    std::atomic<bool> callbackDone{false};
    std::atomic<bool> firstSlow{true};
    slow.onDataChange = [&] {
        if (firstSlow.exchange(false)) {
            inCallback.set_value();
            Sleep(1000);
            callbackDone = true;
        }
    };
    {
        ComPtr<IConnectionPointContainer> container;
        ComPtr<IConnectionPoint> otherPoint;
        DWORD otherCookie = 0;
        ASSERT_EQ(other.As(container), S_OK);
        ASSERT_EQ(container->FindConnectionPoint(IID_IOPCDataCallback, otherPoint.Out()), S_OK);
        ASSERT_EQ(otherPoint->Advise(&slow, &otherCookie), S_OK);
    }
    OPCITEMDEF d = {};
    d.szItemID = const_cast<wchar_t *>(kFast);
    d.bActive = TRUE;
    OPCITEMRESULT *r = nullptr;
    HRESULT *e = nullptr;
    ASSERT_EQ(other->AddItems(1, &d, &r, &e), S_OK);
    CoTaskMemFree(r);
    CoTaskMemFree(e);
    other.Reset(); // the client holds nothing of the group any more
    ASSERT_EQ(inCallback.get_future().wait_for(std::chrono::seconds(20)), std::future_status::ready);
    EXPECT_EQ(server->RemoveGroup(second, FALSE), S_OK) << "only the scan held the group";
    EXPECT_TRUE(callbackDone) << "RemoveGroup returned while the callback was running";
    size_t after = slow.Count(Callback::DataChange);
    Sleep(300);
    EXPECT_EQ(slow.Count(Callback::DataChange), after) << "a data change after RemoveGroup returned";
    CoDisconnectObject(&slow, 0);
}

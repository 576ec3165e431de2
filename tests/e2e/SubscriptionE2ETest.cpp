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
    OPCHANDLE never = Add(L"\\\\.\\proc1\\Setpoints.never", 1);
    OPCHANDLE t = Add(kTemperature, 2);
    DWORD slow = 0, queued = 0;
    HRESULT *errors = nullptr;
    ASSERT_EQ(async->Read(1, &never, 60, &slow, &errors), S_OK); // the worker waits about 3 s
    CoTaskMemFree(errors);
    ASSERT_EQ(async->Read(1, &t, 61, &queued, &errors), S_OK);
    CoTaskMemFree(errors);
    EXPECT_EQ(async->Cancel2(queued), S_OK);
    ASSERT_TRUE(sink.WaitFor([](auto &calls) {
        for (const auto &c : calls)
            if (c.kind == Callback::ReadComplete && c.transid == 60)
                return true;
        return false;
    }));
    for (const auto &c : sink.Snapshot())
        EXPECT_NE(c.transid, 61u);
    EXPECT_EQ(sink.Count(Callback::CancelComplete), 0u);

    // A client whose callback fails three times finds its group inactive.
    sink.dataChangeResult = E_FAIL;
    EXPECT_EQ(Publish(std::wstring(kTemperature) + L" 1"), 0);
    EXPECT_EQ(Publish(std::wstring(kTemperature) + L" 2"), 0);
    EXPECT_EQ(Publish(std::wstring(kTemperature) + L" 3"), 0);
    bool active = true;
    for (int i = 0; i < 100 && active; ++i, Sleep(50)) {
        active = StateOf(state.Get()).active != FALSE;
        if (active)
            Publish(std::wstring(kTemperature) + L" " + std::to_wstring(10 + i));
    }
    EXPECT_FALSE(active);
}

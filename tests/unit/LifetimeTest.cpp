// When the server process may leave: the lifetime's steps with a clock of
// the test's own, the bounded exit, and the way into a group.
#include "ComModule.h"
#include "ExitWatchdog.h"
#include "GroupActivity.h"
#include "InProcServer.h"
#include "LockOrder.h"
#include "OPCGroup.h"
#include "ServerLifetime.h"
#include "Trace.h"

#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <thread>
#include <utility>

namespace {
ULONGLONG g_now = 0;
ULONGLONG TestClock()
{
    return g_now;
}

struct FakeRegistration : CClassRegistration {
    bool registered = true;
    int registrations = 0, revocations = 0;
    std::function<void()> whileRevoking;
    HRESULT Register() override
    {
        registered = true;
        ++registrations;
        return S_OK;
    }
    void Revoke() override
    {
        registered = false;
        ++revocations;
        if (auto once = std::exchange(whileRevoking, nullptr))
            once();
    }
};

CServerLifetime::Timing TestTiming()
{
    CServerLifetime::Timing t;
    t.graceMs = 5000;
    t.drainMs = 1500;
    t.now = &TestClock;
    return t;
}

using Phase = CServerLifetime::Phase;
} // namespace

TEST(Lifetime, TheLastReleaseLeadsThroughGraceAndDrainToTheExit)
{
    g_now = 1000;
    FakeRegistration reg;
    CServerLifetime life(reg, TestTiming(), false);
    DWORD wait = 0;
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
    EXPECT_EQ(wait, INFINITE) << "started by hand, never used: it stays";

    ASSERT_TRUE(life.TryLock());
    life.Unlock(); // the last object is gone at 1000
    g_now = 5999;
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
    EXPECT_EQ(wait, 1u) << "the rest of the grace period";
    EXPECT_TRUE(reg.registered);

    g_now = 6000;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    EXPECT_FALSE(reg.registered) << "revoked before the decision";
    EXPECT_EQ(wait, 1500u);
    g_now = 7499;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    g_now = 7500;
    EXPECT_EQ(life.Advance(wait), Phase::Stopped);
    EXPECT_FALSE(life.TryLock()) << "a creation after the decision gets CO_E_SERVER_STOPPING";
    EXPECT_EQ(life.Count(), 0);
    EXPECT_EQ(reg.registrations, 0);
}

TEST(Lifetime, AnythingThatArrivesBeforeTheDecisionKeepsTheServer)
{
    g_now = 0;
    FakeRegistration reg;
    CServerLifetime life(reg, TestTiming(), true); // started by COM: idle from its start
    DWORD wait = 0;
    g_now = 4000;
    ASSERT_TRUE(life.TryLock()); // a new object during the grace period
    g_now = 9000;
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
    EXPECT_EQ(wait, INFINITE) << "an object lives: no exit planned";
    life.Unlock();

    // Draining: a client that fetched the class object just before the
    // revocation calls in; the registration is back before its call is served.
    g_now = 14000;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    life.IncomingCall();
    EXPECT_TRUE(reg.registered);
    EXPECT_EQ(reg.registrations, 1);
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
    EXPECT_EQ(wait, 5000u) << "the grace period starts over";

    // Draining again: a creation through a class object the client held.
    g_now = 19000;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    ASSERT_TRUE(life.TryLock());
    EXPECT_TRUE(reg.registered);
    g_now = 30000;
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
    life.Unlock();

    // A call in a serving process changes nothing.
    life.IncomingCall();
    EXPECT_EQ(reg.registrations, 2);
    g_now = 35000;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    g_now = 36500;
    EXPECT_EQ(life.Advance(wait), Phase::Stopped);
    life.IncomingCall();
    EXPECT_FALSE(reg.registered) << "nothing comes back after the decision";
}

TEST(Lifetime, CallsDuringTheGracePeriodPutTheRevocationOff)
{
    // The platform's own request for the class object is such a call: the
    // class object must not go between its arrival and its lookup.
    g_now = 0;
    FakeRegistration reg;
    CServerLifetime life(reg, TestTiming(), true);
    g_now = 4000;
    life.IncomingCall();
    DWORD wait = 0;
    g_now = 5000;
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
    EXPECT_EQ(wait, 4000u) << "idle from the last call";
    EXPECT_TRUE(reg.registered);
    g_now = 9000;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    EXPECT_EQ(reg.revocations, 1);
}

TEST(Lifetime, ACallArrivingDuringTheRevocationRestoresTheClassObject)
{
    // The platform forgets the class object before it stops handing it out:
    // a client's call can reach the process while the revocation is still
    // under way, and must find the class object again.
    g_now = 0;
    FakeRegistration reg;
    CServerLifetime life(reg, TestTiming(), true);
    std::thread caller;
    std::atomic<bool> returned{false};
    reg.whileRevoking = [&] {
        caller = std::thread([&] {
            life.IncomingCall();
            returned = true;
        });
        // A call that took no notice ends at once; one that waits for the
        // revocation to finish is still waiting.
        for (int i = 0; i < 20 && !returned; ++i)
            Sleep(10);
    };
    g_now = 5000;
    DWORD wait = 0;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    caller.join();
    EXPECT_TRUE(reg.registered) << "the call found no class object";
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
}

TEST(Lifetime, TheWakeEventTellsTheMainThreadOfTheLastRelease)
{
    g_now = 0;
    FakeRegistration reg;
    CServerLifetime life(reg, TestTiming(), false);
    DWORD wait = 0;
    ASSERT_TRUE(life.TryLock());
    life.Advance(wait);
    EXPECT_EQ(WaitForSingleObject(life.WakeEvent(), 0), WAIT_TIMEOUT);
    life.Unlock();
    EXPECT_EQ(WaitForSingleObject(life.WakeEvent(), 0), WAIT_OBJECT_0);
    long failures = AssertionFailureCount();
    life.Unlock(); // one release too many
    EXPECT_EQ(life.Count(), 0);
    EXPECT_EQ(AssertionFailureCount(), failures + 1);
}

TEST(Lifetime, LockServerUnlocksOnlyWhatItLocked)
{
    CServerClassFactory factory;
    LONG before = ComModule::LockCount();
    EXPECT_EQ(factory.LockServer(FALSE), S_OK);
    EXPECT_EQ(ComModule::LockCount(), before) << "an unlock without a lock is ignored";
    EXPECT_EQ(factory.LockServer(TRUE), S_OK);
    EXPECT_EQ(ComModule::LockCount(), before + 1);
    EXPECT_EQ(factory.LockServer(FALSE), S_OK);
    EXPECT_EQ(factory.LockServer(FALSE), S_OK);
    EXPECT_EQ(ComModule::LockCount(), before);
}

namespace {
struct BlockedExit {
    HANDLE uninitialised = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    std::atomic<bool> expired{false};
    ~BlockedExit() { CloseHandle(uninitialised); }
    static void Expire(void *self)
    {
        auto *exit = static_cast<BlockedExit *>(self);
        exit->expired = true;
        SetEvent(exit->uninitialised); // in the process: TerminateProcess
    }
};
} // namespace

TEST(Lifetime, AnExitThatBlocksEndsWhenTheBoundHasPassed)
{
    BlockedExit blocked;
    {
        CExitWatchdog watchdog(200, &BlockedExit::Expire, &blocked);
        // The platform's uninitialisation, blocked until the watchdog acts.
        EXPECT_EQ(WaitForSingleObject(blocked.uninitialised, 30000), WAIT_OBJECT_0);
    }
    EXPECT_TRUE(blocked.expired);

    BlockedExit quick;
    {
        CExitWatchdog watchdog(30000, &BlockedExit::Expire, &quick);
    }
    EXPECT_FALSE(quick.expired) << "an exit within the bound is left alone";
}

TEST(GroupGuard, EveryGroupMethodFailsOnceRemovalHasBegun)
{
    auto server = CreateInProcServer();
    auto g = AddGroup(server.Get(), L"going", 100, TRUE);
    ASSERT_EQ(g.hr, S_OK);
    auto *group = static_cast<COPCGroup *>(g.group.Get());
    group->BeginRemoval(); // as RemoveGroup does before it lets go

    DWORD d = 0;
    BOOL b = FALSE;
    LPWSTR name = nullptr;
    LONG bias = 0;
    FLOAT deadband = 0;
    OPCHANDLE h = 1, client = 0, handle = 0;
    HRESULT *errors = nullptr;
    OPCITEMRESULT *results = nullptr;
    OPCITEMSTATE *states = nullptr;
    VARIANT v;
    VariantInit(&v);
    OPCITEMDEF def = {};
    def.szItemID = const_cast<wchar_t *>(L"\\\\.\\proc1\\Waveform.sine");
    ComPtr<IOPCItemMgt> items;
    ComPtr<IOPCSyncIO> sync;
    ComPtr<IOPCAsyncIO> async1;
    ComPtr<IOPCAsyncIO2> async2;
    ComPtr<IDataObject> data;
    ComPtr<IConnectionPointContainer> container;
    ASSERT_EQ(g.group.As(items), S_OK);
    ASSERT_EQ(g.group.As(sync), S_OK);
    ASSERT_EQ(g.group.As(async1), S_OK);
    ASSERT_EQ(g.group.As(async2), S_OK);
    ASSERT_EQ(g.group.As(data), S_OK);
    ASSERT_EQ(g.group.As(container), S_OK);
    FORMATETC format = {static_cast<CLIPFORMAT>(RegisterClipboardFormatA("OPCSTMFORMATDATA")), nullptr,
                        DVASPECT_CONTENT, -1, TYMED_HGLOBAL};
    ComPtr<IUnknown> unknown;
    ComPtr<IConnectionPoint> point;
    ComPtr<IEnumConnectionPoints> points;

    const HRESULT calls[] = {
        g.group->GetState(&d, &b, &name, &bias, &deadband, &d, &client, &handle),
        g.group->SetState(&d, &d, &b, &bias, &deadband, &d, &client),
        g.group->SetName(L"other"),
        g.group->CloneGroup(L"clone", IID_IUnknown, unknown.Out()),
        items->AddItems(1, &def, &results, &errors),
        items->ValidateItems(1, &def, FALSE, &results, &errors),
        items->RemoveItems(1, &h, &errors),
        items->SetActiveState(1, &h, TRUE, &errors),
        items->SetClientHandles(1, &h, &client, &errors),
        items->SetDatatypes(1, &h, &v.vt, &errors),
        items->CreateEnumerator(IID_IEnumOPCItemAttributes, unknown.Out()),
        sync->Read(OPC_DS_CACHE, 1, &h, &states, &errors),
        sync->Write(1, &h, &v, &errors),
        async1->Read(1, OPC_DS_CACHE, 1, &h, &d, &errors),
        async1->Write(1, 1, &h, &v, &d, &errors),
        async1->Refresh(1, OPC_DS_CACHE, &d),
        async1->Cancel(1),
        async2->Read(1, &h, 1, &d, &errors),
        async2->Write(1, &h, &v, 1, &d, &errors),
        async2->Refresh2(OPC_DS_CACHE, 1, &d),
        async2->Cancel2(1),
        async2->SetEnable(TRUE),
        async2->GetEnable(&b),
        data->DAdvise(&format, 0, nullptr, &d),
        data->DUnadvise(1),
        data->QueryGetData(&format),
        container->FindConnectionPoint(IID_IOPCDataCallback, point.Out()),
        container->EnumConnectionPoints(points.Out()),
    };
    for (size_t i = 0; i < std::size(calls); ++i)
        EXPECT_EQ(calls[i], E_FAIL) << "call " << i;
    EXPECT_FALSE(name);
    EXPECT_FALSE(results);
    EXPECT_FALSE(errors);
    EXPECT_EQ(server->RemoveGroup(g.handle, TRUE), S_OK) << "the removal still completes";
}

TEST(GroupGuard, ARemovalWaitsForCallsButNeverForItsOwnOrForCallbacksWhenNested)
{
    // The bookkeeping alone, with callers made up by the test.
    LogicalCaller a{{1, 0, 0, {0}}, 1}, b{{2, 0, 0, {0}}, 2};
    CGroupActivity activity;
    ASSERT_TRUE(activity.EnterCall(a));
    activity.AddWork();                                    // a scan...
    CGroupActivity::Kind kind = activity.BeginCallback(b); // ...inside b's callback
    EXPECT_EQ(kind, CGroupActivity::Kind::WorkCallback);
    std::atomic<bool> done{false};
    std::thread remover([&] {
        // A removal from b's own logical thread: b's callback is not waited
        // for, a's call is.
        CallbacksInFlight::Enter(b);
        activity.MarkRemoving();
        activity.WaitForRemoval(b);
        CallbacksInFlight::Leave(b);
        done = true;
    });
    Sleep(100);
    EXPECT_FALSE(done) << "a's call is in flight";
    EXPECT_FALSE(activity.EnterCall(a)) << "no new call once removal has begun";
    activity.LeaveCall(a);
    remover.join();
    EXPECT_TRUE(done);
    activity.EndCallback(b, kind);
    activity.ReleaseWork();
}

TEST(LockOrderCheck, ALockTakenAfterALaterOneIsReported)
{
    long failures = AssertionFailureCount();
    int server = 0, group = 0, item = 0;
    EXPECT_TRUE(LockOrder::Acquire(&server, LockOrder::Server));
    EXPECT_TRUE(LockOrder::Acquire(&group, LockOrder::Group));
    EXPECT_TRUE(LockOrder::Acquire(&server, LockOrder::Server)) << "recursion is allowed";
    LockOrder::Release(&server);
    EXPECT_TRUE(LockOrder::Acquire(&item, LockOrder::Leaf));
    LockOrder::Release(&item);
    LockOrder::Release(&group);
    LockOrder::Release(&server);
    EXPECT_EQ(AssertionFailureCount(), failures);

    EXPECT_TRUE(LockOrder::Acquire(&group, LockOrder::Group));
    EXPECT_FALSE(LockOrder::Acquire(&server, LockOrder::Server)) << "the server lock inside a group lock";
    LockOrder::Release(&server);
    LockOrder::Release(&group);
    EXPECT_EQ(AssertionFailureCount(), failures + 1);
}

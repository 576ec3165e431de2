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
    Use use = Use::Shared;
    int switches = 0, probes = 0;
    std::function<void()> whileSwitching;
    HRESULT Register(Use to) override
    {
        registered = true;
        use = to;
        return S_OK;
    }
    HRESULT Switch(Use to) override
    {
        ++switches;
        use = to;
        if (auto once = std::exchange(whileSwitching, nullptr))
            once();
        return S_OK;
    }
    void Revoke() override { registered = false; }
    void Probe() override { ++probes; }
};

CServerLifetime::Timing TestTiming()
{
    CServerLifetime::Timing t;
    t.graceMs = 5000;
    t.drainMs = 1500;
    t.probeRetryMs = 300;
    t.probeLimitMs = 5000;
    t.probes = 4;
    t.now = &TestClock;
    return t;
}

using Phase = CServerLifetime::Phase;
using Use = CClassRegistration::Use;
} // namespace

TEST(Lifetime, TheLastReleaseLeadsThroughGraceDrainAndAProbeToTheExit)
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
    EXPECT_EQ(reg.use, Use::Shared);

    g_now = 6000;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    EXPECT_EQ(reg.use, Use::Once) << "given out to one more client only";
    EXPECT_TRUE(reg.registered);
    EXPECT_EQ(wait, 1500u);
    g_now = 7499;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    EXPECT_EQ(reg.probes, 0) << "clients on their way come first";
    g_now = 7500;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    EXPECT_EQ(reg.probes, 1);

    // The probe takes the registry's last answer: nobody else can hold one.
    EXPECT_FALSE(life.ClassObjectQueried(true)) << "a probe never gets the class object";
    life.ProbeFinished();
    EXPECT_EQ(life.Advance(wait), Phase::Stopped);
    EXPECT_FALSE(reg.registered);
    EXPECT_FALSE(life.TryLock()) << "a creation after the decision gets CO_E_SERVER_STOPPING";
    EXPECT_EQ(life.Count(), 0);
}

TEST(Lifetime, AnyClientThatArrivesBeforeTheDecisionKeepsTheServer)
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

    // Draining: a client that got the registry's answer looks the class up.
    g_now = 14000;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    EXPECT_TRUE(life.ClassObjectQueried(false));
    EXPECT_EQ(reg.use, Use::Shared) << "every client may have it again";
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
    EXPECT_EQ(wait, 5000u) << "the grace period starts over";

    // Draining again: a creation through a class object the client held.
    g_now = 19000;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    ASSERT_TRUE(life.TryLock());
    EXPECT_EQ(reg.use, Use::Shared);
    g_now = 30000;
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
    life.Unlock();

    // A client's lookup while serving puts the switch off.
    g_now = 34000;
    EXPECT_TRUE(life.ClassObjectQueried(false));
    g_now = 35000;
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
    EXPECT_EQ(wait, 4000u);

    // A client arrives while the probe is out: the probe, coming back to a
    // serving process, takes nothing.
    g_now = 39000;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    g_now = 40500;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    EXPECT_EQ(reg.probes, 1);
    EXPECT_TRUE(life.ClassObjectQueried(false));
    EXPECT_FALSE(life.ClassObjectQueried(true));
    life.ProbeFinished();
    EXPECT_EQ(life.Advance(wait), Phase::Serving);
    EXPECT_EQ(wait, 5000u);
    EXPECT_TRUE(reg.registered);
}

TEST(Lifetime, ProbesThatFindAnotherServerEndTheDrainAfterTheirNumber)
{
    g_now = 0;
    FakeRegistration reg;
    CServerLifetime life(reg, TestTiming(), true);
    DWORD wait = 0;
    g_now = 5000;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    // Another copy's probe that got the shared registration before the
    // switch reaches the class object after it: it took nothing.
    g_now = 5100;
    EXPECT_FALSE(life.ClassObjectQueried(true));
    g_now = 6500;
    for (int probe = 1; probe <= 4; ++probe) {
        EXPECT_EQ(life.Advance(wait), Phase::Draining) << "probe " << probe;
        EXPECT_EQ(reg.probes, probe);
        g_now += 10;
        life.ProbeFinished(); // it found another server first
        EXPECT_EQ(life.Advance(wait), Phase::Draining);
        EXPECT_EQ(wait, 300u);
        g_now += 300;
    }
    EXPECT_EQ(life.Advance(wait), Phase::Stopped) << "behind a registration that clients reach first";
    EXPECT_FALSE(reg.registered);

    // A probe that never comes back ends the drain at its limit.
    g_now = 0;
    FakeRegistration stuckReg;
    CServerLifetime stuck(stuckReg, TestTiming(), true);
    g_now = 5000;
    EXPECT_EQ(stuck.Advance(wait), Phase::Draining);
    g_now = 6500;
    EXPECT_EQ(stuck.Advance(wait), Phase::Draining);
    EXPECT_EQ(wait, 5000u);
    g_now = 11499;
    EXPECT_EQ(stuck.Advance(wait), Phase::Draining);
    g_now = 11500;
    EXPECT_EQ(stuck.Advance(wait), Phase::Stopped);
    stuck.ProbeFinished(); // late
    EXPECT_EQ(stuck.Advance(wait), Phase::Stopped);
    EXPECT_EQ(stuckReg.probes, 1);
}

TEST(Lifetime, ALookupDuringTheSwitchFindsTheServerServingAgain)
{
    // The platform may look the class object up on the switching thread
    // while it registers it; a client's lookup on another thread waits for
    // the switch and switches back.
    g_now = 0;
    FakeRegistration reg;
    CServerLifetime life(reg, TestTiming(), true);
    std::thread client;
    std::atomic<bool> returned{false};
    bool platformLookup = false;
    reg.whileSwitching = [&] {
        platformLookup = life.ClassObjectQueried(false);
        client = std::thread([&] {
            EXPECT_TRUE(life.ClassObjectQueried(false));
            returned = true;
        });
        for (int i = 0; i < 20 && !returned; ++i)
            Sleep(10);
    };
    g_now = 5000;
    DWORD wait = 0;
    EXPECT_EQ(life.Advance(wait), Phase::Draining);
    client.join();
    EXPECT_TRUE(platformLookup);
    EXPECT_EQ(reg.switches, 2) << "the platform's own lookup switched nothing";
    EXPECT_EQ(reg.use, Use::Shared);
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

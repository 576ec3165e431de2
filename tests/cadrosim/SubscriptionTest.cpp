#include "SimFixture.h"

#include <future>
#include <thread>

namespace {
std::vector<uint32_t> Statuses(const std::vector<Delivery> &ds)
{
    std::vector<uint32_t> out;
    for (const auto &d : ds)
        if (d.kind == Delivery::Status)
            out.push_back(d.status);
    return out;
}
} // namespace

TEST_F(SimTest, SubscribeReportsStatusThenAttributesThenValues)
{
    ASSERT_TRUE(Subscribe(L"\\\\.\\p\\o.num"));
    void *cookie = LastCookie();
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, cookie, 1); }));
    auto ds = Of(recorder.Snapshot(), cookie);
    ASSERT_GE(ds.size(), 6u);
    EXPECT_EQ(Statuses(ds), (std::vector<uint32_t>{13, 14, 16, 17}));
    EXPECT_EQ(ds[4].kind, Delivery::Attributes);
    EXPECT_EQ(ds[4].type, kCadroNumber);
    EXPECT_EQ(ds[4].access, 3u);
    EXPECT_EQ(ds[5].kind, Delivery::Data);
    EXPECT_EQ(ds[5].flags, 7u);
    EXPECT_EQ(ds[5].error, 0);
    EXPECT_NE(ds[5].time.dwHighDateTime, 0u);

    // The host's own name, an object's implicit member, a described member,
    // nested objects and a quoted name all resolve.
    for (const std::wstring &url : {L"\\\\" + Host() + L"\\p\\o.ro", std::wstring(L"\\\\.\\p\\o"),
                                    std::wstring(L"\\\\.\\p\\o.dash"), std::wstring(L"\\\\.\\p\\o\\inner.deep"),
                                    std::wstring(L"\\\\.\\p\\'o'.'num'"), std::wstring(L"\\\\other\\q\\z.tick")}) {
        HRESULT hr;
        EXPECT_TRUE(Subscribe(url, &hr)) << url;
        EXPECT_EQ(hr, S_OK);
    }
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, LastCookie(), 1); }));
    void *implicit = reinterpret_cast<char *>(cookie) + 2;
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, implicit, 42); }));
}

TEST_F(SimTest, UnknownUrlsFailWithStatus18AndNoItem)
{
    for (const wchar_t *url : {L"\\\\.\\p\\o.missing", L"\\\\nowhere\\p\\o.num", L"\\\\.\\p", L"garbage", L"",
                               L"\\\\.\\p\\o.num.extra", L"\\\\.\\p\\'o.num"}) {
        HRESULT hr = S_OK;
        EXPECT_FALSE(Subscribe(url, &hr)) << url;
        EXPECT_LT(hr, 0) << url;
        auto ds = Of(recorder.Snapshot(), LastCookie());
        EXPECT_EQ(Statuses(ds), (std::vector<uint32_t>{13, 14, 16, 18})) << url;
    }
    SubscribeOptions options = {13, 7, 0, 0, 0};
    CadroDataItem *item = nullptr;
    EXPECT_EQ(realTime->Subscribe(nullptr, nullptr, &options, &item), E_POINTER);
    EXPECT_EQ(realTime->Subscribe(L"\\\\.\\p\\o.num", nullptr, &options, nullptr), E_POINTER);
}

TEST_F(SimTest, ValuesArriveAtTheMemberPeriodAndReadGivesTheNewest)
{
    CadroDataItem *item = Subscribe(L"\\\\.\\p\\o.fast");
    ASSERT_TRUE(item);
    void *cookie = LastCookie();
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return DataCount(all, cookie) >= 10; }));
    auto ds = Of(recorder.Snapshot(), cookie);
    double last = -1;
    for (const auto &d : ds) {
        if (d.kind != Delivery::Data)
            continue;
        EXPECT_GT(d.number, last) << "a counter only goes up";
        last = d.number;
    }
    uint32_t flags = 0;
    CadroValue value = {};
    int32_t error = -1;
    FILETIME time = {};
    ASSERT_EQ(item->Read(&flags, &value, &error, &time), S_OK);
    EXPECT_EQ(flags, 7u);
    EXPECT_EQ(value.type, kCadroNumber);
    EXPECT_GE(value.number, last);

    CadroDataItem *never = Subscribe(L"\\\\.\\p\\o.never");
    ASSERT_TRUE(never);
    ASSERT_EQ(never->Read(&flags, &value, &error, &time), S_OK);
    EXPECT_EQ(flags & kCadroHasValue, 0u) << "no value yet";
    Sleep(100);
    EXPECT_EQ(recorder.Count(LastCookie(), Delivery::Data), 0u);
    EXPECT_EQ(Statuses(Of(recorder.Snapshot(), LastCookie())), (std::vector<uint32_t>{13, 14, 16, 17}));
}

TEST_F(SimTest, WritesComeBackAsUpdatesAndReadOnlyMembersRefuse)
{
    CadroDataItem *num = Subscribe(L"\\\\.\\p\\o.num");
    void *numCookie = LastCookie();
    CadroDataItem *watcher = Subscribe(L"\\\\.\\p\\o.num"); // a second subscriber sees the echo too
    void *watcherCookie = LastCookie();
    CadroDataItem *ro = Subscribe(L"\\\\.\\p\\o.ro");
    CadroDataItem *wide = Subscribe(L"\\\\.\\p\\o.wide");
    void *wideCookie = LastCookie();
    CadroDataItem *narrow = Subscribe(L"\\\\.\\p\\o.narrow");
    void *narrowCookie = LastCookie();
    ASSERT_TRUE(num && watcher && ro && wide && narrow);
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, watcherCookie, 1); }));

    CadroValue v = {};
    v.type = kCadroNumber;
    v.number = 99.5;
    EXPECT_EQ(num->Write(&v), S_OK);
    EXPECT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, numCookie, 99.5); }));
    EXPECT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, watcherCookie, 99.5); }));

    EXPECT_EQ(ro->Write(&v), E_ACCESSDENIED);
    EXPECT_NE(Command(L"show \\\\.\\p\\o.ro").find(L"value 5\n"), std::wstring::npos);

    // Texts travel as text objects: wide ones through NewUnicodeGuts, and
    // narrow members deliver narrow text.
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) {
        for (const auto &d : Of(all, narrowCookie))
            if (d.kind == Delivery::Data && d.type == kCadroNarrowText && d.text == L"abc")
                return true;
        return false;
    }));
    CadroValue text = {};
    text.type = kCadroWideText;
    text.text = NewUnicodeGuts(L"hello");
    EXPECT_EQ(wide->Write(&text), S_OK);
    text.text->Release();
    EXPECT_TRUE(recorder.WaitFor([&](auto &all) {
        for (const auto &d : Of(all, wideCookie))
            if (d.kind == Delivery::Data && d.type == kCadroWideText && d.text == L"hello")
                return true;
        return false;
    }));
    CadroValue empty = {};
    empty.type = kCadroWideText; // no text object: the empty text
    EXPECT_EQ(narrow->Write(&empty), S_OK);
    EXPECT_NE(Command(L"show \\\\.\\p\\o.narrow").find(L"value \n"), std::wstring::npos);
    CadroValue bad = {};
    bad.type = 77;
    EXPECT_EQ(num->Write(&bad), DISP_E_TYPEMISMATCH);
    EXPECT_EQ(num->Write(nullptr), E_POINTER);
}

TEST_F(SimTest, SubscribersOfOneMemberComeAndGoInAnyOrder)
{
    // The first subscriber of a member is kept in place and later ones in
    // an array that grows: releases from the front, the middle and the end
    // must leave exactly the others receiving.
    std::vector<CadroDataItem *> subs;
    std::vector<void *> cookies;
    for (int i = 0; i < 6; ++i) {
        subs.push_back(Subscribe(L"\\\\.\\p\\o.num"));
        cookies.push_back(LastCookie());
        ASSERT_TRUE(subs.back());
    }
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, cookies[5], 1); }));
    for (int gone : {0, 3, 5}) {
        Drop(subs[gone]);
        subs[gone] = nullptr;
    }
    EXPECT_NE(Command(L"show \\\\.\\p\\o.num").find(L"subscriptions 3\n"), std::wstring::npos);
    CadroValue v = {};
    v.type = kCadroNumber;
    v.number = 64.25;
    ASSERT_EQ(subs[1]->Write(&v), S_OK);
    for (int kept : {1, 2, 4})
        EXPECT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, cookies[kept], 64.25); })) << kept;
    for (int gone : {0, 3, 5})
        EXPECT_FALSE(HasData(recorder.Snapshot(), cookies[gone], 64.25)) << gone;
    subs.push_back(Subscribe(L"\\\\.\\p\\o.num")); // into a freed place
    void *last = LastCookie();
    EXPECT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, last, 64.25); }));
}

TEST_F(SimTest, ReleaseEndsCallbacksBeforeItReturns)
{
    for (int round = 0; round < 20; ++round) {
        CadroDataItem *item = Subscribe(L"\\\\.\\p\\o.fast");
        void *cookie = LastCookie();
        ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return DataCount(all, cookie) >= 2; }));
        Drop(item);
        size_t after = recorder.Count(cookie, Delivery::Data);
        Sleep(20);
        EXPECT_EQ(recorder.Count(cookie, Delivery::Data), after) << "no callback after Release returned";
    }
    // A receiver that releases its item from inside its own callback.
    CadroDataItem *self = Subscribe(L"\\\\.\\p\\o.fast");
    void *selfCookie = LastCookie();
    std::atomic<CadroDataItem *> pending{self};
    items.clear(); // released by the callback
    recorder.onData = [&](void *cookie) {
        if (cookie == selfCookie)
            if (CadroDataItem *it = pending.exchange(nullptr))
                it->Release();
    };
    ASSERT_TRUE(recorder.WaitFor([&](auto &) { return pending.load() == nullptr; }));
    Sleep(30);
    size_t n = recorder.Count(selfCookie, Delivery::Data);
    Sleep(30);
    EXPECT_EQ(recorder.Count(selfCookie, Delivery::Data), n);
    recorder.onData = nullptr;
}

TEST_F(SimTest, ASubscriptionReleasedInAnotherOnesCallbackHearsNothingMoreOfTheSameTick)
{
    // Two subscriptions of one member get each tick's value in one batch;
    // the first to hear it releases the other, which must not be called
    // for that tick (or any later one), whichever of them comes first.
    for (int round = 0; round < 10; ++round) {
        CadroDataItem *a = Subscribe(L"\\\\.\\p\\o.fast");
        void *aCookie = LastCookie();
        CadroDataItem *b = Subscribe(L"\\\\.\\p\\o.fast");
        void *bCookie = LastCookie();
        ASSERT_TRUE(
            recorder.WaitFor([&](auto &all) { return DataCount(all, aCookie) >= 2 && DataCount(all, bCookie) >= 2; }));
        items.erase(std::remove(items.begin(), items.end(), b), items.end());
        std::atomic<CadroDataItem *> pending{b};
        std::atomic<size_t> heardBefore{SIZE_MAX};
        recorder.onData = [&](void *cookie) {
            CadroDataItem *victim = cookie == aCookie ? pending.exchange(nullptr) : nullptr;
            if (!victim)
                return;
            size_t before = recorder.Count(bCookie, Delivery::Data);
            victim->Release();
            heardBefore = before;
        };
        ASSERT_TRUE(recorder.WaitFor([&](auto &) { return heardBefore.load() != SIZE_MAX; }));
        size_t seen = DataCount(recorder.Snapshot(), aCookie);
        ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return DataCount(all, aCookie) >= seen + 2; }));
        EXPECT_EQ(recorder.Count(bCookie, Delivery::Data), heardBefore.load()) << "round " << round;
        recorder.onData = nullptr;
        Drop(a);
    }
}

TEST_F(SimTest, AReleaseThatWaitsForACallbackOwnsItsSubscriptionUntilItReturns)
{
    // One subscription's callback holds the shard while a second one of the
    // same member waits in the queue; the second is released from another
    // thread meanwhile. The shard must not delete it when its event comes up
    // while the release still waits: it was deleted twice, and its receiver
    // released twice.
    std::promise<void> inCallback, goOn;
    std::shared_future<void> goOnFuture = goOn.get_future().share();
    std::atomic<void *> blocking{nullptr};
    recorder.onData = [&](void *cookie) {
        if (cookie == blocking.load() && blocking.exchange(nullptr)) {
            inCallback.set_value();
            goOnFuture.wait();
        }
    };
    blocking = NextCookie();
    ASSERT_TRUE(Subscribe(L"\\\\.\\p\\o.num", nullptr, blocking.load()));
    ASSERT_EQ(inCallback.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);
    ULONG refs = recorder.Refs();
    CadroDataItem *queued = nullptr;
    SubscribeOptions options = {13, 7, 0, 0, 0};
    ASSERT_EQ(realTime->Subscribe(L"\\\\.\\p\\o.num", NextCookie(), &options, &queued), S_OK);
    auto release = std::async(std::launch::async, [queued] { queued->Release(); });
    Sleep(100); // the release now waits for the callback
    goOn.set_value();
    ASSERT_EQ(release.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    Sleep(100);
    EXPECT_EQ(recorder.Refs(), refs) << "the released subscription lets go of its receiver once";
    recorder.onData = nullptr;
}

TEST_F(SimTest, AChangingSourceReportsNoValueBeforeItsFirst)
{
    // Its starting number (0 here) is nothing the source ever produces.
    ASSERT_TRUE(Subscribe(L"\\\\other\\q\\z.noisy"));
    void *cookie = LastCookie();
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return DataCount(all, cookie) >= 3; }));
    for (const Delivery &d : Of(recorder.Snapshot(), cookie))
        if (d.kind == Delivery::Data) {
            EXPECT_GE(d.number, 9.5);
            EXPECT_LE(d.number, 10.5);
        }
}

TEST_F(SimTest, FaultsDisconnectStallAndBadQuality)
{
    Subscribe(L"\\\\other\\q\\z.tick");
    void *tick = LastCookie();
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return DataCount(all, tick) >= 2; }));
    EXPECT_EQ(Command(L"disconnect OTHER"), L"ok\n");
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) {
        auto s = Statuses(Of(all, tick));
        return !s.empty() && s.back() == 15;
    }));
    Sleep(50);
    size_t during = recorder.Count(tick, Delivery::Data);
    Sleep(100);
    EXPECT_EQ(recorder.Count(tick, Delivery::Data), during) << "no values while disconnected";
    EXPECT_EQ(Command(L"reconnect OTHER"), L"ok\n");
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return DataCount(all, tick) > during + 1; }));
    auto s = Statuses(Of(recorder.Snapshot(), tick));
    EXPECT_EQ(std::vector<uint32_t>(s.end() - 4, s.end()), (std::vector<uint32_t>{13, 14, 16, 17}));

    EXPECT_EQ(Command(L"stall \\\\other\\q\\z.tick"), L"ok\n");
    Sleep(60);
    size_t stalled = recorder.Count(tick, Delivery::Data);
    Sleep(100);
    EXPECT_EQ(recorder.Count(tick, Delivery::Data), stalled);
    EXPECT_EQ(Command(L"unstall \\\\other\\q\\z.tick"), L"ok\n");

    Subscribe(L"\\\\.\\p\\o.ro");
    void *ro = LastCookie();
    EXPECT_EQ(Command(L"publish \\\\.\\p\\o.ro 17 quality=bad time=2026-01-02T03:04:05.678Z"), L"ok\n");
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, ro, 17); }));
    for (const auto &d : Of(recorder.Snapshot(), ro)) {
        if (d.kind == Delivery::Data && d.number == 17) {
            EXPECT_EQ(d.error, 1);
            SYSTEMTIME st;
            FileTimeToSystemTime(&d.time, &st);
            EXPECT_EQ(st.wYear, 2026);
            EXPECT_EQ(st.wSecond, 5);
            EXPECT_EQ(st.wMilliseconds, 678);
        }
    }
    EXPECT_EQ(Command(L"publish \\\\.\\p\\o.ro notanumber").rfind(L"error:", 0), 0u);
    EXPECT_EQ(Command(L"publish \\\\.\\p\\o.missing 1").rfind(L"error:", 0), 0u);
    EXPECT_EQ(Command(L"disconnect NOWHERE").rfind(L"error:", 0), 0u);
    EXPECT_EQ(Command(L"frobnicate").rfind(L"error:", 0), 0u);
}

TEST_F(SimTest, AMachineOfAnotherNodeThatCannotBeReachedWaitsForIt)
{
    // Port 1 of the loopback address: nothing listens, the node is away.
    BSTR error = nullptr;
    ASSERT_EQ(CadroSim_Load((std::wstring(kTestNetwork) + L"machine FAR node=[::1]:1\n").c_str(), &error), S_OK)
        << (error ? error : L"");
    EXPECT_NE(Command(L"browse \\").find(L"\\\\FAR"), std::wstring::npos);
    EXPECT_NE(Command(L"status").find(L"machine FAR served by the node at [::1]:1"), std::wstring::npos);
    std::wstring refused = Command(L"publish \\\\FAR\\p\\o.m 1");
    EXPECT_EQ(refused, L"error: that machine is served by the node at [::1]:1: run the command there\n");
    EXPECT_EQ(Command(L"browse \\\\FAR\\p").rfind(L"error: unknown URL", 0), 0u);

    // Taken, and told that its machine is being connected to, as on a
    // disconnected machine; the machine's own members go on as before.
    HRESULT hr = E_FAIL;
    void *away = NextCookie();
    ASSERT_NE(Subscribe(L"\\\\FAR\\p\\o.m", &hr, away), nullptr);
    EXPECT_EQ(hr, S_OK);
    auto has = [](void *cookie, Delivery::Kind kind, uint32_t status) {
        return [=](const std::vector<Delivery> &all) {
            return std::any_of(all.begin(), all.end(), [&](const Delivery &d) {
                return d.cookie == cookie && d.kind == kind && (kind != Delivery::Status || d.status == status);
            });
        };
    };
    EXPECT_TRUE(recorder.WaitFor(has(away, Delivery::Status, 13)));
    EXPECT_EQ(recorder.Count(away, Delivery::Data), 0u);
    void *here = NextCookie();
    ASSERT_NE(Subscribe(L"\\\\" + Host() + L"\\p\\o.num", nullptr, here), nullptr);
    EXPECT_TRUE(recorder.WaitFor(has(here, Delivery::Data, 0)));
    // Loading another network lets go of the node's link.
    EXPECT_EQ(Command(L"reset"), L"ok\n");
}

TEST_F(SimTest, AComputedMemberNobodyHeardGivesANewSubscriberACurrentValue)
{
    // Nobody receives the counter for a while, so nothing computes it; the
    // next subscriber still gets a value of now, not the last one computed.
    CadroDataItem *first = Subscribe(L"\\\\.\\p\\o.fast");
    ASSERT_TRUE(first);
    void *firstCookie = LastCookie();
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return DataCount(all, firstCookie) >= 2; }));
    Drop(first);
    double lastHeard = 0;
    for (const Delivery &d : Of(recorder.Snapshot(), firstCookie))
        if (d.kind == Delivery::Data)
            lastHeard = d.number;
    Sleep(200);

    FILETIME before = {};
    GetSystemTimeAsFileTime(&before);
    ASSERT_TRUE(Subscribe(L"\\\\.\\p\\o.fast"));
    void *cookie = LastCookie();
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return DataCount(all, cookie) >= 1; }));
    Delivery fresh = FirstData(recorder.Snapshot(), cookie);
    EXPECT_GE(CompareFileTime(&fresh.time, &before), 0) << "the first value is stamped before the subscription";
    EXPECT_GT(fresh.number, lastHeard) << "the first value is the one computed last";

    // A member that only takes published values keeps the published one.
    Command(L"publish \\\\.\\p\\o.num 9");
    Sleep(50);
    FILETIME published = {};
    GetSystemTimeAsFileTime(&published);
    ASSERT_TRUE(Subscribe(L"\\\\.\\p\\o.num"));
    void *constCookie = LastCookie();
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return DataCount(all, constCookie) >= 1; }));
    Delivery kept = FirstData(recorder.Snapshot(), constCookie);
    EXPECT_EQ(kept.number, 9);
    EXPECT_LT(CompareFileTime(&kept.time, &published), 0) << "a published value keeps its time stamp";
}

TEST_F(SimTest, MembersOfOnePeriodTickOnWhileOthersOfItLeaveAndReturn)
{
    // Members of one period tick together from one array: those that lose
    // their last subscriber leave it (the last takes the place of each), and
    // neither the ones that stay nor the ones that come back may be lost.
    const int count = 40;
    std::vector<CadroDataItem *> subs;
    std::vector<void *> cookies;
    for (int i = 0; i < count; ++i) {
        std::wstring name = L"m" + std::to_wstring(i);
        ASSERT_EQ(Command(L"add-member \\\\.\\p\\cadence " + name + L" type=number access=r source=counter period=10"),
                  L"ok\n");
        subs.push_back(Subscribe(L"\\\\.\\p\\cadence." + name));
        ASSERT_TRUE(subs.back());
        cookies.push_back(LastCookie());
    }
    auto eachHas = [&](int from, int step, auto atLeast) {
        return recorder.WaitFor([&](auto &all) {
            for (int i = from; i < count; i += step)
                if (DataCount(all, cookies[i]) < atLeast(i))
                    return false;
            return true;
        });
    };
    ASSERT_TRUE(eachHas(0, 1, [](int) { return size_t{3}; }));
    for (int i = 0; i < count; i += 2)
        Drop(subs[i]);
    std::vector<size_t> before(count);
    for (int i = 1; i < count; i += 2)
        before[i] = recorder.Count(cookies[i], Delivery::Data);
    EXPECT_TRUE(eachHas(1, 2, [&](int i) { return before[i] + 3; })) << "the members that stayed tick on";
    for (int i = 0; i < count; i += 2) {
        ASSERT_TRUE(Subscribe(L"\\\\.\\p\\cadence.m" + std::to_wstring(i)));
        cookies[i] = LastCookie();
    }
    EXPECT_TRUE(eachHas(0, 2, [](int) { return size_t{3}; })) << "the members that came back tick again";
}

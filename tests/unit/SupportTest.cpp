#include "ManualResetEvent.h"
#include "SinkRelease.h"
#include "tw/hmx/osdep/OSException.h"
#include "tw/hmx/osdep/WideToAnsi.h"

#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

using namespace tw::hmx;

namespace {
std::string FakeIcuDir(const char *variant)
{
    char self[MAX_PATH];
    GetModuleFileNameA(nullptr, self, MAX_PATH);
    std::string dir(self);
    return dir.substr(0, dir.find_last_of('\\')) + "\\fakeicu\\" + variant;
}
} // namespace

TEST(Support, IcuBindingNeedsBothLibrariesAndEveryEntryPoint)
{
    // Before any stand-in is loaded (a bare-name load would find a loaded one).
    osdep::Icu absent("C:\\no\\such\\dir");
    EXPECT_FALSE(absent.IsBound()) << "no ICU there nor on the search path";
    // The process-wide binding finds no ICU here: conversions of text raise.
    EXPECT_THROW(osdep::WideToAnsi(L"x", ""), exception::LibraryNotLoaded);
    EXPECT_STREQ(osdep::WideToAnsi(L"", "").get(), "") << "an empty text needs no ICU";

    osdep::Icu full(FakeIcuDir("full"));
    EXPECT_TRUE(full.IsBound());
    EXPECT_NE(full.u_strcasecmp, nullptr);
    osdep::Icu partial(FakeIcuDir("partial"));
    EXPECT_FALSE(partial.IsBound()) << "a missing entry point leaves the binding unbound";
    EXPECT_EQ(partial.ucnv_fromUChars, nullptr);
}

TEST(Support, WideToAnsiSubstitutesAndChecksTheEncoding)
{
    osdep::Icu icu(FakeIcuDir("full"));
    ASSERT_TRUE(icu.IsBound());
    std::wstring text = L"caf\u00e9 \u20ac!";
    EXPECT_STREQ(osdep::WideToAnsi(text.data(), text.data() + text.size(), "", icu).get(), "caf\xe9 ?!");
    EXPECT_STREQ(osdep::WideToAnsi(text.data(), text.data() + text.size(), "US-ASCII", icu).get(), "caf? ?!");
    std::wstring allOut(50, L'\u4e2d');
    EXPECT_EQ(std::string(osdep::WideToAnsi(allOut.data(), allOut.data() + allOut.size(), "", icu).get()),
              std::string(50, '?'));
    EXPECT_THROW(osdep::WideToAnsi(text.data(), text.data() + 1, "KLINGON", icu), exception::InvalidLocale);
    EXPECT_THROW(osdep::WideToAnsi(text.data(), text.data(), nullptr, icu), exception::InvalidLocale)
        << "the encoding is checked first, even for an empty text";
    try {
        osdep::WideToAnsi(L"", nullptr);
        FAIL();
    } catch (const exception::InvalidLocale &e) {
        EXPECT_STREQ(e.message(), "Invalid locale.");
        EXPECT_EQ(e.code(), static_cast<long>(0x8ABC7024));
        EXPECT_STREQ(e.source(), "tw/hmx/osdep/WideToAnsi");
        EXPECT_EQ(e.line(), 103);
    }
}

TEST(Support, ExceptionsCarryMessagesCodesAndSources)
{
    exception::LibraryNotLoaded missing("tw/hmx/osdep/icu", 59);
    EXPECT_STREQ(missing.what(), "Failed to load library");
    EXPECT_EQ(missing.code(), static_cast<long>(0x8ABC7021));
    EXPECT_EQ(exception::Exception().code(), -1);
    EXPECT_STREQ(exception::Exception().message(), "unspecified exception");
    osdep::OSException os("text", 5);
    EXPECT_EQ(os.code(), 42);
    EXPECT_EQ(os.osError(), 5u);

    struct {
        unsigned long windows;
        long mapped;
    } map[] = {{0, 0},    {2, 7},  {3, 7},   {4, 11},    {5, static_cast<long>(0x80070005)},
               {6, 1},    {8, 2},  {11, 23}, {14, 2},    {15, 7},
               {16, 8},   {19, 8}, {20, 37}, {23, -508}, {32, 8},
               {33, 8},   {38, 4}, {39, 9},  {80, -98},  {87, 1},
               {1234, 42}};
    for (const auto &m : map)
        EXPECT_EQ(osdep::WinError::MapCode(m.windows), m.mapped) << m.windows;
    osdep::WinError denied("", ERROR_ACCESS_DENIED);
    std::string text = denied.message();
    EXPECT_FALSE(text.empty());
    EXPECT_EQ(text.find('\r'), std::string::npos);
    EXPECT_NE(text.back(), '.') << "the final period is dropped: " << text;

    osdep::SharedLibrary none("");
    EXPECT_FALSE(none.IsLoaded());
    EXPECT_EQ(none.GetSymbol("x", true), nullptr);
    try {
        none.GetSymbol("x");
        FAIL();
    } catch (const osdep::WinError &e) {
        EXPECT_STREQ(e.message(), "library not loaded");
        EXPECT_EQ(e.osError(), 9999u);
    }
    osdep::SharedLibrary kernel("kernel32.dll");
    EXPECT_NE(kernel.GetSymbol("GetTickCount"), nullptr);
    try {
        kernel.GetSymbol("NoSuchEntryPoint");
        FAIL();
    } catch (const osdep::WinError &e) {
        EXPECT_STREQ(e.source(), "tw/hmx/osdep/SharedLibrary");
        EXPECT_EQ(e.line(), 161);
    }
}

TEST(Support, SlimLockExcludesUnderContention)
{
    // Threads that keep finding the lock held go to sleep on it and must be
    // woken by the release, never lost; a plain counter shows any overlap.
    CSlimLock lock;
    long counter = 0;
    const int threads = 4, rounds = 200000;
    std::vector<std::thread> workers;
    for (int t = 0; t < threads; ++t)
        workers.emplace_back([&] {
            for (int i = 0; i < rounds; ++i) {
                CSlimLockHolder held(&lock);
                long seen = counter;
                if (i % 1000 == 0)
                    Sleep(0); // held across a yield now and then: others sleep
                counter = seen + 1;
            }
        });
    for (std::thread &worker : workers)
        worker.join();
    EXPECT_EQ(counter, static_cast<long>(threads) * rounds);
}

TEST(Support, ManualResetEventWakesItsWaitersAndTimesOut)
{
    CSlimLock lock;
    CManualResetEvent event;
    EXPECT_FALSE(event.Wait(lock, 30)); // nothing set it
    // A setter on another thread, which needs the lock that the waiter
    // must let go of while it sleeps.
    for (int round = 0; round < 20; ++round) {
        std::thread setter([&] {
            Sleep(round % 3);
            CSlimLockHolder held(&lock);
            event.Set();
        });
        EXPECT_TRUE(event.Wait(lock, 60000)) << round;
        setter.join();
        CSlimLockHolder held(&lock);
        event.Reset();
    }
    EXPECT_FALSE(event.Wait(lock, 10)); // reset again
    {
        CSlimLockHolder held(&lock);
        event.Set();
    }
    EXPECT_TRUE(event.Wait(lock, 0)); // already set: no sleep
}

namespace {
// A sink that says it is a proxy, as the proxy manager does, and counts its
// references.
class ProxyLikeSink : public IMultiQI {
public:
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override
    {
        if (!IsEqualIID(riid, IID_IUnknown) && !(IsEqualIID(riid, IID_IMultiQI) && proxy)) {
            *ppv = nullptr;
            return E_NOINTERFACE;
        }
        *ppv = this;
        AddRef();
        return S_OK;
    }
    STDMETHODIMP_(ULONG) AddRef() override { return ++refs; }
    STDMETHODIMP_(ULONG) Release() override { return --refs; }
    STDMETHODIMP QueryMultipleInterfaces(ULONG, MULTI_QI *) override { return E_NOTIMPL; }

    bool proxy = true;
    std::atomic<ULONG> refs{1};
};
} // namespace

TEST(SinkReleaseTest, AClientsSinkIsLetGoAMomentLaterAndOneInThisProcessAtOnce)
{
    ProxyLikeSink remote, local;
    local.proxy = false;
    EXPECT_TRUE(SinkRelease::IsRemote(&remote));
    EXPECT_FALSE(SinkRelease::IsRemote(&local));
    EXPECT_EQ(remote.refs.load(), 1u) << "the question holds no reference";
    {
        remote.AddRef();
        local.AddRef();
        CSinkRef<IUnknown> a = CSinkRef<IUnknown>::Attach(&remote, true);
        CSinkRef<IUnknown> b = CSinkRef<IUnknown>::Attach(&local, false);
        CSinkRef<IMultiQI> copy = a.As<IMultiQI>();
        EXPECT_EQ(remote.refs.load(), 3u);
    }
    EXPECT_EQ(local.refs.load(), 1u) << "released at once";
    EXPECT_EQ(remote.refs.load(), 3u) << "both references still held a moment";
    DWORD start = GetTickCount();
    while (remote.refs.load() != 1 && GetTickCount() - start < 20000)
        Sleep(10);
    EXPECT_EQ(remote.refs.load(), 1u) << "released later, by the releaser";
}

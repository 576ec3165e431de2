// node_client: another process on the network node, as a server's libraries
// are. It subscribes to one member and prints what arrives ("status N",
// "value V age A", A the milliseconds since the value's time stamp) for a
// number of seconds, or until a given value arrives. With --ready it sets
// the named event at the first value: a test then knows that the
// subscription is in place before it acts on the network.
//
// With --many it subscribes to members m0 to m<count - 1> of one object,
// one after another as a server's AddItems does, and prints how many
// subscriptions were made and how many had their first value in time:
// "subscribed N failed F", then "first values K".
//
// With --shared it subscribes to one member count times (the library puts
// them in one feed), lets go of the first, the middle and the last of them
// and of two of their neighbours, writes a new value through one that is kept and subscribes once more:
// "shared kept K/N released-with-value R newcomer yes|no", K the kept ones
// that had the new value, R the released ones that had it nonetheless.
//
// With --receivers it subscribes to one member once for each of 257
// receivers (a session each), when the library keeps 256 receivers at most:
// "receivers subscribed S refused F valued V again yes|no", V the receivers
// that got their own value, and whether the last one could subscribe once
// the first had let go.
#include "CadroSim.h"
#include "Unknown.h"

#include <atomic>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cwchar>
#include <memory>
#include <string>
#include <vector>

namespace {
// Milliseconds from a value's time stamp to now.
long long AgeMs(uint32_t low, uint32_t high)
{
    FILETIME now;
    GetSystemTimeAsFileTime(&now);
    auto ticks = [](uint32_t l, uint32_t h) { return (static_cast<long long>(h) << 32) | l; };
    return (ticks(now.dwLowDateTime, now.dwHighDateTime) - ticks(low, high)) / 10000;
}

class Printer : public CSimUnknown<ICadroRealTimeReceiver> {
public:
    Printer(double last, HANDLE done, HANDLE ready) : m_last(last), m_done(done), m_ready(ready) {}
    HRESULT STDMETHODCALLTYPE OnData(void *, uint32_t flags, const CadroValue *value, int32_t, uint32_t low,
                                     uint32_t high) override
    {
        if ((flags & kCadroHasValue) && value->type == kCadroNumber) {
            printf("value %.17g age %lld\n", value->number, AgeMs(low, high));
            if (value->number == m_last)
                SetEvent(m_done);
            if (m_ready)
                SetEvent(m_ready);
        }
        fflush(stdout);
        return S_OK;
    }
    HRESULT STDMETHODCALLTYPE OnAttributes(void *, const CadroAttributes *) override { return S_OK; }
    HRESULT STDMETHODCALLTYPE StatusChange(void *, uint32_t status, uint32_t, uint32_t) override
    {
        printf("status %u\n", status);
        fflush(stdout);
        return S_OK;
    }

private:
    double m_last;
    HANDLE m_done;
    HANDLE m_ready;
};

// Counts the subscriptions (their cookies are their indexes) that have had
// a value, and the values that were not their member's (member m<i> holds
// i); done when all have had one.
class FirstValues : public CSimUnknown<ICadroRealTimeReceiver> {
public:
    FirstValues(size_t count, HANDLE done) : m_seen(count), m_done(done) {}
    HRESULT STDMETHODCALLTYPE OnData(void *cookie, uint32_t flags, const CadroValue *value, int32_t, uint32_t,
                                     uint32_t) override
    {
        size_t i = reinterpret_cast<size_t>(cookie);
        if ((flags & kCadroHasValue) && (value->type != kCadroNumber || value->number != static_cast<double>(i)))
            ++m_wrong;
        if ((flags & kCadroHasValue) && i < m_seen.size() && !m_seen[i].exchange(true) && ++m_count == m_seen.size())
            SetEvent(m_done);
        return S_OK;
    }
    HRESULT STDMETHODCALLTYPE OnAttributes(void *, const CadroAttributes *) override { return S_OK; }
    HRESULT STDMETHODCALLTYPE StatusChange(void *, uint32_t, uint32_t, uint32_t) override { return S_OK; }
    size_t Count() const { return m_count.load(); }
    size_t Wrong() const { return m_wrong.load(); }

private:
    std::atomic<size_t> m_wrong{0};
    std::vector<std::atomic<bool>> m_seen;
    std::atomic<size_t> m_count{0};
    HANDLE m_done;
};

// The newest number each subscription (its cookie is its index) was given;
// NaN before the first.
class Latest : public CSimUnknown<ICadroRealTimeReceiver> {
public:
    explicit Latest(size_t count) : m_values(count)
    {
        for (auto &v : m_values)
            v.store(NAN);
    }
    HRESULT STDMETHODCALLTYPE OnData(void *cookie, uint32_t flags, const CadroValue *value, int32_t, uint32_t,
                                     uint32_t) override
    {
        size_t i = reinterpret_cast<size_t>(cookie);
        if ((flags & kCadroHasValue) && value->type == kCadroNumber && i < m_values.size())
            m_values[i].store(value->number);
        return S_OK;
    }
    HRESULT STDMETHODCALLTYPE OnAttributes(void *, const CadroAttributes *) override { return S_OK; }
    HRESULT STDMETHODCALLTYPE StatusChange(void *, uint32_t, uint32_t, uint32_t) override { return S_OK; }
    double Of(size_t i) const { return m_values[i].load(); }

private:
    std::vector<std::atomic<double>> m_values;
};

// Whether done() holds within 30 seconds.
template <class Done> bool WaitUntil(Done done)
{
    for (int i = 0; i < 3000; ++i) {
        if (done())
            return true;
        Sleep(10);
    }
    return done();
}

int SubscribeShared(const std::wstring &url, size_t count)
{
    if (count < 6)
        return 2;
    auto *receiver = new Latest(count + 1);
    CadroRealTime *realTime = nullptr;
    if (!CadroSim_NewRealTime(receiver, &realTime)) {
        receiver->Release();
        return 1;
    }
    SubscribeOptions options = {13, 7, 0, 0, 0};
    std::vector<CadroDataItem *> items(count + 1, nullptr);
    for (size_t i = 0; i < count; ++i)
        realTime->Subscribe(url.c_str(), reinterpret_cast<void *>(i), &options, &items[i]);
    WaitUntil([&] {
        for (size_t i = 0; i < count; ++i)
            if (std::isnan(receiver->Of(i)))
                return false;
        return true;
    });
    // The list's two ends and its middle, then the neighbours that their
    // going left linked to new ones.
    const size_t released[] = {0, count / 2, count - 1, count / 2 - 1, count - 2};
    for (size_t i : released) {
        if (items[i])
            items[i]->Release();
        items[i] = nullptr;
    }
    const double next = 4242.5;
    CadroValue value = {};
    value.type = kCadroNumber;
    value.number = next;
    if (items[1])
        items[1]->Write(&value);
    size_t kept = 0, keptWithValue = 0;
    WaitUntil([&] {
        kept = keptWithValue = 0;
        for (size_t i = 0; i < count; ++i)
            if (items[i]) {
                ++kept;
                keptWithValue += receiver->Of(i) == next;
            }
        return kept == keptWithValue;
    });
    Sleep(200); // time for a wrong delivery to arrive
    size_t releasedWithValue = 0;
    for (size_t i : released)
        releasedWithValue += receiver->Of(i) == next;
    realTime->Subscribe(url.c_str(), reinterpret_cast<void *>(count), &options, &items[count]);
    bool newcomer = WaitUntil([&] { return receiver->Of(count) == next; });
    printf("shared kept %lu/%lu released-with-value %lu newcomer %s\n", static_cast<unsigned long>(keptWithValue),
           static_cast<unsigned long>(kept), static_cast<unsigned long>(releasedWithValue), newcomer ? "yes" : "no");
    for (CadroDataItem *item : items)
        if (item)
            item->Release();
    realTime->Release();
    receiver->Release();
    return 0;
}

int SubscribeReceivers(const std::wstring &url)
{
    const size_t count = 257;
    struct Session {
        Latest *receiver = nullptr;
        CadroRealTime *realTime = nullptr;
        CadroDataItem *item = nullptr;
    };
    std::vector<Session> sessions(count);
    SubscribeOptions options = {13, 7, 0, 0, 0};
    size_t subscribed = 0, refused = 0;
    for (Session &s : sessions) {
        s.receiver = new Latest(1);
        if (!CadroSim_NewRealTime(s.receiver, &s.realTime))
            return 1;
        if (SUCCEEDED(s.realTime->Subscribe(url.c_str(), nullptr, &options, &s.item)))
            ++subscribed;
        else
            ++refused;
    }
    size_t valued = 0;
    WaitUntil([&] {
        valued = 0;
        for (Session &s : sessions)
            valued += s.item && !std::isnan(s.receiver->Of(0));
        return valued == subscribed;
    });
    sessions.front().item->Release();
    sessions.front().item = nullptr;
    Session &last = sessions.back();
    bool again = !last.item && SUCCEEDED(last.realTime->Subscribe(url.c_str(), nullptr, &options, &last.item)) &&
                 WaitUntil([&] { return !std::isnan(last.receiver->Of(0)); });
    printf("receivers subscribed %lu refused %lu valued %lu again %s\n", static_cast<unsigned long>(subscribed),
           static_cast<unsigned long>(refused), static_cast<unsigned long>(valued), again ? "yes" : "no");
    for (Session &s : sessions) {
        if (s.item)
            s.item->Release();
        s.realTime->Release();
        s.receiver->Release();
    }
    return 0;
}

int SubscribeMany(const std::wstring &object, size_t count, DWORD seconds)
{
    HANDLE done = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    auto *receiver = new FirstValues(count, done);
    CadroRealTime *realTime = nullptr;
    if (!CadroSim_NewRealTime(receiver, &realTime)) {
        receiver->Release();
        return 1;
    }
    SubscribeOptions options = {13, 7, 0, 0, 0};
    std::vector<CadroDataItem *> items(count, nullptr);
    size_t failed = 0;
    for (size_t i = 0; i < count; ++i) {
        std::wstring url = object + L".m" + std::to_wstring(i);
        if (FAILED(realTime->Subscribe(url.c_str(), reinterpret_cast<void *>(i), &options, &items[i])))
            ++failed;
    }
    printf("subscribed %lu failed %lu\n", static_cast<unsigned long>(count), static_cast<unsigned long>(failed));
    fflush(stdout);
    WaitForSingleObject(done, seconds * 1000);
    printf("first values %lu\n", static_cast<unsigned long>(receiver->Count()));
    printf("wrong values %lu\n", static_cast<unsigned long>(receiver->Wrong()));
    for (CadroDataItem *item : items)
        if (item)
            item->Release();
    realTime->Release();
    receiver->Release();
    CloseHandle(done);
    return failed ? 1 : 0;
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    if (argc == 3 && wcscmp(argv[1], L"--receivers") == 0)
        return SubscribeReceivers(argv[2]);
    if (argc == 4 && wcscmp(argv[1], L"--shared") == 0)
        return SubscribeShared(argv[2], wcstoul(argv[3], nullptr, 10));
    if (argc == 5 && wcscmp(argv[1], L"--many") == 0)
        return SubscribeMany(argv[2], wcstoul(argv[3], nullptr, 10), wcstoul(argv[4], nullptr, 10));
    HANDLE ready = nullptr;
    if (argc > 2 && wcscmp(argv[1], L"--ready") == 0) {
        ready = OpenEventW(EVENT_MODIFY_STATE, FALSE, argv[2]);
        argc -= 2;
        argv += 2;
    }
    if (argc != 3 && argc != 4) {
        fwprintf(stderr, L"usage: node_client [--ready <event name>] <member url> <seconds> [<last value>]\n"
                         L"       node_client --many <object url> <count> <seconds>\n"
                         L"       node_client --shared <member url> <count>\n"
                         L"       node_client --receivers <member url>\n");
        return 2;
    }
    HANDLE done = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    Printer *printer = new Printer(argc == 4 ? _wtof(argv[3]) : NAN, done, ready);
    CadroRealTime *realTime = nullptr;
    if (!CadroSim_NewRealTime(printer, &realTime)) {
        printer->Release();
        return 1;
    }
    SubscribeOptions options = {13, 7, 0, 0, 0};
    CadroDataItem *item = nullptr;
    HRESULT hr = realTime->Subscribe(argv[1], printer, &options, &item);
    printf("subscribed 0x%08lX\n", static_cast<unsigned long>(hr));
    fflush(stdout);
    WaitForSingleObject(done, wcstoul(argv[2], nullptr, 10) * 1000);
    if (item)
        item->Release();
    realTime->Release();
    printer->Release();
    CloseHandle(done);
    if (ready)
        CloseHandle(ready);
    return SUCCEEDED(hr) ? 0 : 1;
}

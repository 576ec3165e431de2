// A node's session with a library that reads slower than values come, or
// not at all: the node holds each member's newest value instead of queueing
// every value, and the library gets the newest of every member once it reads
// again.
#include "Engine.h"
#include "NodeSession.h"
#include "Wire.h"

#include <gtest/gtest.h>

#include <condition_variable>
#include <map>
#include <mutex>

using namespace cadrosim;

namespace {
// The library's end of a pipe: the test hands the session frames to read,
// and holds its writes back while the library "does not read".
class HeldChannel : public Channel {
public:
    bool Read(std::string &buffer) override
    {
        std::unique_lock<std::mutex> l(m_lock);
        m_changed.wait(l, [&] { return m_closed || !m_toRead.empty(); });
        if (m_closed)
            return false;
        buffer += m_toRead;
        m_toRead.clear();
        return true;
    }
    bool Write(const std::string &bytes) override
    {
        std::unique_lock<std::mutex> l(m_lock);
        m_changed.wait(l, [&] { return m_closed || !m_held; });
        if (m_closed)
            return false;
        m_written += bytes;
        return true;
    }
    void Close() override
    {
        std::lock_guard<std::mutex> l(m_lock);
        m_closed = true;
        m_changed.notify_all();
    }
    void Send(std::string_view frames)
    {
        std::lock_guard<std::mutex> l(m_lock);
        m_toRead.append(frames);
        m_changed.notify_all();
    }
    void Hold(bool held)
    {
        std::lock_guard<std::mutex> l(m_lock);
        m_held = held;
        m_changed.notify_all();
    }
    std::string Written()
    {
        std::lock_guard<std::mutex> l(m_lock);
        return m_written;
    }

private:
    std::mutex m_lock;
    std::condition_variable m_changed;
    std::string m_toRead, m_written;
    bool m_held = false;
    bool m_closed = false;
};

// The newest number each library id has been sent, directly or through
// the feed it joined.
std::map<uint32_t, double> NewestById(std::string bytes)
{
    std::map<uint32_t, double> byId, byFeed;
    std::map<uint32_t, uint32_t> feedOf;
    size_t consumed = 0;
    wire::TakeFrames(bytes, consumed, [&](wire::Kind kind, wire::In in) {
        if (kind == wire::Kind::Joined) {
            uint32_t id = in.U32();
            feedOf[in.U32()] = id;
            return;
        }
        if (kind != wire::Kind::Data && kind != wire::Kind::FeedData)
            return;
        in.U32();
        CadroValue value;
        in.Value(value);
        in.U32();
        in.U32();
        in.U32();
        while (in.Ok() && !in.AtEnd()) {
            uint32_t id = in.U32();
            (kind == wire::Kind::Data ? byId : byFeed)[id] = value.number;
        }
    });
    for (auto [feed, number] : byFeed)
        if (feedOf.count(feed))
            byId[feedOf[feed]] = number;
    return byId;
}

double ShownValue(Engine &engine, const std::wstring &url)
{
    std::wstring shown = engine.Execute(L"show " + url);
    size_t at = shown.find(L"\nvalue ");
    return at == std::wstring::npos ? -1 : _wtof(shown.c_str() + at + 7);
}
} // namespace

TEST(SlowReader, ALibraryThatStopsReadingGetsEachMembersNewestValueAndCostsTheNodeLittle)
{
    // An engine of this test's own, as a node has it (the libraries' engine
    // in the DLL is another).
    Engine &engine = Engine::Instance();
    engine.AddUse();
    const uint32_t count = 2000;
    auto url = [](uint32_t i) { return L"\\\\.\\p\\behind.m" + std::to_wstring(i); };
    std::wstring description = L"machine $HOST\nprocess p\nobject behind\n";
    for (uint32_t i = 0; i < count; ++i)
        description += L"member m" + std::to_wstring(i) + L" type=number access=r source=counter period=5 step=" +
                       std::to_wstring(i + 1) + L"\n"; // values of their own: no frame carries two
    std::wstring error;
    ASSERT_TRUE(engine.Load(description, error)) << error;
    auto channel = std::make_shared<HeldChannel>();
    channel->Hold(true); // the library reads nothing
    HANDLE ended = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    NodeSession *session = NodeSession::Start(engine, channel, false, ended);
    ASSERT_TRUE(session);
    wire::Out subscribe;
    for (uint32_t i = 0; i < count; ++i) {
        subscribe.Begin(wire::Kind::Subscribe);
        subscribe.U32(0);
        subscribe.U32(i + 1);
        subscribe.Text(url(i));
        subscribe.End();
    }
    channel->Send(subscribe.View());

    // Some 16 MB of values a second: queued whole, they would pass the
    // limit within two seconds; held, the queue stays at it.
    Sleep(2000);
    EXPECT_LT(session->QueuedBytes(), size_t{8} << 20);

    // The members stop changing: their last values can only come from what
    // the node held back.
    std::vector<double> atRelease(count);
    for (uint32_t i = 0; i < count; ++i) {
        ASSERT_EQ(engine.Execute(L"stall " + url(i)), L"ok\n");
        atRelease[i] = ShownValue(engine, url(i));
    }
    channel->Hold(false);
    uint32_t behind = count;
    for (int waited = 0; waited < 200 && behind; ++waited, Sleep(50)) {
        std::map<uint32_t, double> newest = NewestById(channel->Written());
        behind = 0;
        for (uint32_t i = 0; i < count; ++i)
            behind += !newest.count(i + 1) || newest[i + 1] != atRelease[i];
    }
    EXPECT_EQ(behind, 0u) << "members whose value at the release never arrived";

    channel->Close();
    EXPECT_EQ(WaitForSingleObject(ended, 10000), WAIT_OBJECT_0);
    session->Join();
    session->Release();
    CloseHandle(ended);
    engine.ReleaseUse();
}

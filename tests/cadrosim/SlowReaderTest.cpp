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

// The newest value each library id has been sent, directly or through the
// feeds it joined, as take(value) gives it.
template <class Take> auto NewestById(std::string bytes, Take take)
{
    using Taken = decltype(take(std::declval<const CadroValue &>()));
    std::map<uint32_t, Taken> byId;
    std::map<uint32_t, std::vector<uint32_t>> joined; // by feed
    wire::TakeFrames(bytes, [&](wire::Kind kind, wire::In in) {
        if (kind == wire::Kind::Joined) {
            uint32_t id = in.U32();
            joined[in.U32()].push_back(id);
            return;
        }
        if (kind != wire::Kind::Data && kind != wire::Kind::FeedData)
            return;
        in.U32();
        CadroValue value;
        in.Value(value);
        Taken taken = take(value);
        ClearCadroValue(value);
        in.U32();
        in.U32();
        in.U32();
        while (in.Ok() && !in.AtEnd()) {
            uint32_t id = in.U32();
            if (kind == wire::Kind::Data)
                byId[id] = taken;
            else
                for (uint32_t member : joined[id])
                    byId[member] = taken;
        }
    });
    return byId;
}

std::map<uint32_t, double> NewestById(std::string bytes)
{
    return NewestById(std::move(bytes), [](const CadroValue &value) { return value.number; });
}

std::map<uint32_t, std::wstring> NewestTextById(std::string bytes)
{
    return NewestById(std::move(bytes), [](const CadroValue &value) {
        std::wstring text = L"(not a text)";
        if (value.type & kCadroTextBit)
            TextOf(value, text);
        return text;
    });
}

void SendSubscribe(HeldChannel &channel, uint32_t id, const std::wstring &url)
{
    wire::Out out;
    out.Begin(wire::Kind::Subscribe);
    out.U32(0);
    out.U32(id);
    out.Text(url);
    out.End();
    channel.Send(out.View());
}

double ShownValue(Engine &engine, const std::wstring &url)
{
    std::wstring shown = engine.Execute(L"show " + url);
    size_t at = shown.find(L"\nvalue ");
    return at == std::wstring::npos ? -1 : _wtof(shown.c_str() + at + 7);
}

// A node's session on an engine of the test's own, as a node has it (the
// libraries' engine in the DLL is another), serving a library whose end of
// the pipe the test holds.
class NodeSessionTest : public ::testing::Test {
protected:
    void SetUp() override { engine.AddUse(); }
    // Loads the network and starts the session (held: the library reads
    // nothing until told).
    void Start(const std::wstring &network, bool held)
    {
        std::wstring error;
        ASSERT_TRUE(engine.Load(network, error)) << error;
        channel->Hold(held);
        session = NodeSession::Start(engine, channel, false, ended);
        ASSERT_TRUE(session);
    }
    void TearDown() override
    {
        channel->Close();
        if (session) {
            EXPECT_EQ(WaitForSingleObject(ended, 10000), WAIT_OBJECT_0);
            session->Join();
            session->Release();
        }
        CloseHandle(ended);
        engine.ReleaseUse();
    }

    Engine &engine = Engine::Instance();
    std::shared_ptr<HeldChannel> channel = std::make_shared<HeldChannel>();
    HANDLE ended = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    NodeSession *session = nullptr;
};
} // namespace

TEST_F(NodeSessionTest, ALibraryThatStopsReadingGetsEachMembersNewestValueAndCostsTheNodeLittle)
{
    const uint32_t count = 2000;
    auto url = [](uint32_t i) { return L"\\\\.\\p\\behind.m" + std::to_wstring(i); };
    std::wstring description = L"machine $HOST\nprocess p\nobject behind\n";
    for (uint32_t i = 0; i < count; ++i)
        description += L"member m" + std::to_wstring(i) + L" type=number access=r source=counter period=5 step=" +
                       std::to_wstring(i + 1) + L"\n"; // values of their own: no frame carries two
    ASSERT_NO_FATAL_FAILURE(Start(description, true)); // the library reads nothing
    for (uint32_t i = 0; i < count; ++i)
        SendSubscribe(*channel, i + 1, url(i));

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
}

// A newcomer to a running feed is told the member's last value, a long text
// or a short one, whichever came last; a feed made again in a freed place
// starts with nothing of the last one's.
TEST_F(NodeSessionTest, ANewcomerIsToldTheFeedsLastValueWhateverItsLength)
{
    ASSERT_NO_FATAL_FAILURE(
        Start(L"machine $HOST\nprocess p\nobject t\nmember words type=wtext access=rw value=\"first\"\n"
              L"member other type=number access=rw value=1\n",
              false));
    const std::wstring url = L"\\\\.\\p\\t.words";
    auto waitFor = [&](uint32_t id, const std::wstring &text) {
        for (int waited = 0; waited < 200; ++waited, Sleep(25)) {
            auto newest = NewestTextById(channel->Written());
            if (newest.count(id) && newest[id] == text)
                return true;
        }
        return false;
    };
    const std::wstring longText = L"a text far longer than what a feed keeps in place";
    SendSubscribe(*channel, 1, url);
    ASSERT_TRUE(waitFor(1, L"first"));
    ASSERT_EQ(engine.Execute(L"publish " + url + L" \"" + longText + L"\""), L"ok\n");
    ASSERT_TRUE(waitFor(1, longText));
    SendSubscribe(*channel, 2, url);
    EXPECT_TRUE(waitFor(2, longText)) << "the long text";
    ASSERT_EQ(engine.Execute(L"publish " + url + L" ab"), L"ok\n");
    ASSERT_TRUE(waitFor(1, L"ab"));
    SendSubscribe(*channel, 3, url);
    EXPECT_TRUE(waitFor(3, L"ab")) << "the short text after the long one";

    auto unsubscribe = [&](uint32_t id) {
        wire::Out leave;
        leave.Begin(wire::Kind::Unsubscribe);
        leave.U32(id);
        leave.End();
        channel->Send(leave.View());
    };
    // Every member leaves, the first first (the last takes its place): the
    // feed's place is freed only when the last has gone, and another URL's
    // feed takes it.
    unsubscribe(1);
    ASSERT_EQ(engine.Execute(L"publish " + url + L" cd"), L"ok\n");
    EXPECT_TRUE(waitFor(3, L"cd")) << "the feed goes on for the others";
    unsubscribe(3);
    unsubscribe(2);
    ASSERT_EQ(engine.Execute(L"publish " + url + L" \"" + longText + L"\""), L"ok\n");
    SendSubscribe(*channel, 4, L"\\\\.\\p\\t.other");
    SendSubscribe(*channel, 5, L"\\\\.\\p\\t.other");
    Sleep(500);
    auto numbers = NewestById(channel->Written());
    EXPECT_EQ(numbers.count(4) ? numbers[4] : -1, 1.0);
    EXPECT_EQ(numbers.count(5) ? numbers[5] : -1, 1.0);
    EXPECT_EQ(NewestTextById(channel->Written())[5], L"(not a text)") << "from the feed that held the place before";
}

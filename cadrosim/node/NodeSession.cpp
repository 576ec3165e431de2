#include "NodeSession.h"

#include "PipeChannel.h"
#include "Prefetch.h"
#include "RingChannel.h"
#include "SimValue.h"
#include "ThreadName.h"

#include <cstring>
#include <new>
#include <shared_mutex>
#include <type_traits>
#include <utility>
#include <vector>

namespace cadrosim {

namespace {
// A library that reads nothing for this long is hung: its connection is
// dropped rather than the node's memory filled (it reconnects and
// subscribes again when it recovers).
constexpr size_t kLargestBacklog = 256u << 20;
// A library whose queue holds more than this is behind (it reads slower than
// values come, or not at all): each feed's newest value then waits in the
// feed, and goes out once the queue has been written. The library misses
// values the network no longer has, never the newest, and a library that
// stopped reading costs the node this much, not a queue that grows.
constexpr size_t kBehindBacklog = 4u << 20;
const wchar_t kNoCommands[] = L"the node takes commands from its own machine only";

uint32_t IdOf(void *cookie)
{
    return static_cast<uint32_t>(reinterpret_cast<uintptr_t>(cookie));
}

void *CookieOf(uint32_t id)
{
    return reinterpret_cast<void *>(static_cast<uintptr_t>(id));
}

// A Data frame's fields, packed on the stack when they hold no text.
template <class Use>
void WithFields(uint32_t flags, const CadroValue &value, int32_t error, uint32_t low, uint32_t high, Use use)
{
    wire::PackedFields packed;
    if (packed.Pack(flags, value, error, low, high)) {
        use(packed.View());
        return;
    }
    wire::Out fields;
    fields.U32(flags);
    fields.Value(value);
    fields.U32(static_cast<uint32_t>(error));
    fields.U32(low);
    fields.U32(high);
    use(fields.View());
}
} // namespace

NodeSession *NodeSession::Start(Engine &engine, std::shared_ptr<Channel> channel, bool fromNode, HANDLE ended)
{
    return new (std::nothrow) NodeSession(engine, std::move(channel), fromNode, ended);
}

NodeSession::NodeSession(Engine &engine, std::shared_ptr<Channel> channel, bool fromNode, HANDLE ended)
    : m_engine(engine), m_channel(std::move(channel)), m_fromNode(fromNode), m_endedEvent(ended),
      m_queue(kLargestBacklog)
{
    m_queue.SetDrainedHandler([this] { SendHeld(); });
    m_reader = NamedThread(L"session reader", [this] { ReadLoop(); });
}

void NodeSession::Join()
{
    if (m_reader.joinable())
        m_reader.join();
}

template <class Fill> void NodeSession::Reply(Fill fill)
{
    m_queue.Push(wire::Kind::Reply, fill);
    m_replied = true;
}

std::shared_ptr<Channel> NodeSession::Greet(std::string &buffer)
{
    auto pipe = std::dynamic_pointer_cast<PipeChannel>(m_channel);
    if (!pipe)
        return m_channel;
    // The question is a frame of its kind alone, which no other frame
    // starts like.
    while (buffer.size() < 5)
        if (!m_channel->Read(buffer))
            return nullptr;
    if (static_cast<wire::Kind>(buffer[4]) != wire::Kind::UseRings)
        return m_channel;
    uint32_t length;
    memcpy(&length, buffer.data(), 4);
    if (length != 1 || buffer.size() != 5)
        return nullptr; // nothing may follow the question on the pipe
    buffer.clear();
    std::wstring name;
    std::shared_ptr<Channel> rings = RingChannel::Make(pipe, name);
    wire::Out out;
    out.Begin(wire::Kind::Rings);
    out.Text(rings ? name : L"");
    out.End();
    std::string answer;
    out.Take(answer);
    if (!pipe->Write(answer))
        return nullptr;
    return rings ? rings : m_channel;
}

void NodeSession::ReadLoop()
{
    std::string buffer;
    std::shared_ptr<Channel> stream = Greet(buffer);
    bool fine = stream != nullptr;
    if (fine) {
        m_queue.Attach(stream);
        // A closing word said before there was a channel to say it on.
        if (m_finishing)
            Finish();
    }
    while (fine) {
        fine = wire::TakeFrames(buffer, [&](wire::Kind kind, wire::In in) {
            if (fine)
                fine = Handle(kind, in);
        });
        // The replies to what one read brought go out in one write: a
        // library that reads ahead asks for many listings at once. Without
        // a reply the writing thread writes: this one goes on reading.
        if (std::exchange(m_replied, false))
            m_queue.Flush();
        fine = fine && stream->Read(buffer);
    }
    if (stream)
        stream->Close();
    m_channel->Close();
    ReleaseAll();
    m_queue.Stop(false);
    m_ended = true;
    SetEvent(m_endedEvent);
}

void NodeSession::ReleaseAll()
{
    std::vector<CadroDataItem *> items;
    {
        std::lock_guard<SlimMutex> l(m_feedsLock);
        m_feeds.ForEach([&](Feed *feed) {
            if (feed->item)
                items.push_back(feed->item);
        });
        static_assert(std::is_trivially_destructible_v<Feed>, "the table forgets its feeds without destroying them");
        m_feeds.Clear();
        m_moreMembers.clear();
        m_feedOfUrl.Clear();
        m_memberships.Clear();
    }
    for (CadroDataItem *item : items)
        item->Release();
}

bool NodeSession::Handle(wire::Kind kind, wire::In &in)
{
    switch (kind) {
    case wire::Kind::Subscribe:
        Subscribe(in);
        break;
    case wire::Kind::Unsubscribe:
        Unsubscribe(in.U32());
        break;
    case wire::Kind::Write: {
        uint32_t id = in.U32();
        CadroValue value;
        in.Value(value);
        if (CadroDataItem *item = in.Ok() ? Find(id) : nullptr) {
            item->Write(&value);
            item->Release();
        }
        ClearCadroValue(value);
        break;
    }
    case wire::Kind::List: {
        uint32_t request = in.U32();
        std::wstring url = in.Text();
        if (in.Ok())
            List(request, url);
        break;
    }
    case wire::Kind::Catalogue: {
        uint32_t request = in.U32();
        if (!in.Ok())
            break;
        std::vector<uint64_t> hashes;
        m_engine.Catalogue(hashes);
        Reply([&](wire::Out &out) {
            out.U32(request);
            out.U32(static_cast<uint32_t>(hashes.size()));
            out.Raw(hashes.data(), hashes.size() * sizeof(uint64_t));
        });
        break;
    }
    case wire::Kind::Execute: {
        uint32_t request = in.U32();
        std::wstring command = in.Text();
        if (!in.Ok())
            break;
        // Another machine's node asks for values, never for commands: the
        // port must not let anyone who reaches it load or stop this node.
        std::wstring answer = m_fromNode ? L"error: " + std::wstring(kNoCommands) + L"\n" : m_engine.Execute(command);
        Reply([&](wire::Out &out) {
            out.U32(request);
            out.Text(answer);
        });
        break;
    }
    case wire::Kind::Load: {
        uint32_t request = in.U32();
        std::wstring description = in.Text();
        if (!in.Ok())
            break;
        std::wstring error = kNoCommands;
        bool loaded = !m_fromNode && m_engine.Load(description, error);
        Reply([&](wire::Out &out) {
            out.U32(request);
            out.U8(loaded ? 1 : 0);
            out.Text(error);
        });
        break;
    }
    default:
        return false;
    }
    return in.Ok();
}

void NodeSession::Subscribe(wire::In &in)
{
    uint32_t request = in.U32();
    uint32_t id = in.U32();
    std::wstring url = in.Text();
    if (!in.Ok())
        return;
    if (wire::SubscriptionSlot(id) == UINT32_MAX) {
        if (request)
            Reply([&](wire::Out &out) {
                out.U32(request);
                out.U32(static_cast<uint32_t>(E_INVALIDARG));
            });
        return;
    }
    // A slot used twice (the same id, or a later one of its slot): the
    // later subscription wins.
    uint32_t occupant;
    {
        std::lock_guard<SlimMutex> l(m_feedsLock);
        occupant = Occupant(id);
    }
    if (occupant)
        Unsubscribe(occupant);
    HRESULT hr = S_OK;
    uint32_t fresh = 0; // a new feed, to subscribe on the engine
    {
        std::lock_guard<SlimMutex> l(m_feedsLock);
        uint64_t hash = wire::UrlHash(url);
        uint32_t check = static_cast<uint32_t>(wire::UrlCheck(url));
        Feed *feed = SharedFeed(hash, check);
        if (!feed) {
            feed = NewFeed(hash, check);
            fresh = feed ? feed->id : 0;
        }
        if (feed && !Join(*feed, id)) {
            if (fresh)
                DropFeed(*feed);
            fresh = 0;
            feed = nullptr;
        }
        if (!feed)
            hr = E_OUTOFMEMORY;
    }
    if (fresh) {
        // Outside the lock: the engine may answer at once, from this thread.
        CadroDataItem *item = nullptr;
        hr = m_engine.Subscribe(url.c_str(), CookieOf(fresh), this, &item, m_fromNode, this);
        std::unique_lock<SlimMutex> l(m_feedsLock);
        Feed *feed = FeedOf(fresh);
        bool held = false;
        if (feed && SUCCEEDED(hr)) {
            feed->item = item;
            item = nullptr;
            held = feed->Has(Feed::kHeld);
        } else if (feed) {
            DropFeed(*feed);
        }
        l.unlock();
        if (item)
            item->Release();
        // A first value held back before the feed had its subscription to
        // read it from: it goes out now, unless the library is still behind
        // (then it goes when the queue has been written).
        if (held)
            SendHeld();
    }
    if (request)
        Reply([&](wire::Out &out) {
            out.U32(request);
            out.U32(static_cast<uint32_t>(hr));
        });
}

NodeSession::Feed *NodeSession::SharedFeed(uint64_t hash, uint32_t check)
{
    // Every feed the index holds is in the table: a feed leaves the index
    // before it leaves the table.
    uint32_t id = m_feedOfUrl.Find(hash);
    Feed *feed = id ? FeedOf(id) : nullptr;
    return feed && feed->check == check ? feed : nullptr;
}

void NodeSession::Unshare(Feed &feed)
{
    m_feedOfUrl.Erase(feed.id, feed.hash);
}

template <class Use> bool NodeSession::WithCurrentData(const Feed &feed, Use use)
{
    if (!feed.item || !feed.Has(Feed::kHasData))
        return false;
    // Under m_feedsLock, so that no value of the feed is queued between
    // this read and the caller's use of it: what follows is as new or newer.
    uint32_t flags = 0;
    CadroValue value = {};
    int32_t error = 0;
    FILETIME time = {};
    bool has = SUCCEEDED(feed.item->Read(&flags, &value, &error, &time)) && (flags & kCadroHasValue);
    if (has)
        WithFields(flags, value, error, time.dwLowDateTime, time.dwHighDateTime, use);
    ClearCadroValue(value);
    return has;
}

uint32_t &NodeSession::MemberAt(Feed &feed, uint32_t index)
{
    return index == 0 ? feed.first : m_moreMembers.find(feed.id)->second[index - 1];
}

uint32_t NodeSession::MemberCount(const Feed &feed)
{
    if (feed.first == 0)
        return 0;
    return feed.Has(Feed::kMore) ? 1 + static_cast<uint32_t>(m_moreMembers.find(feed.id)->second.size()) : 1;
}

void NodeSession::AddMember(Feed &feed, uint32_t id)
{
    if (feed.first == 0) {
        feed.first = id;
        return;
    }
    m_moreMembers[feed.id].push_back(id); // an empty array left behind by a failure is harmless
    feed.Set(Feed::kMore, true);
}

void NodeSession::RemoveLastMember(Feed &feed)
{
    if (!feed.Has(Feed::kMore)) {
        feed.first = 0;
        return;
    }
    auto more = m_moreMembers.find(feed.id);
    more->second.pop_back();
    if (more->second.empty()) {
        m_moreMembers.erase(more);
        feed.Set(Feed::kMore, false);
    }
}

template <class Each> void NodeSession::ForEachMember(const Feed &feed, Each each)
{
    if (feed.first == 0)
        return;
    each(feed.first);
    if (feed.Has(Feed::kMore))
        for (uint32_t id : m_moreMembers.find(feed.id)->second)
            each(id);
}

NodeSession::Feed *NodeSession::NewFeed(uint64_t hash, uint32_t check)
{
    try {
        // Room first, so that nothing below can fail half-way.
        m_feedOfUrl.Reserve(1);
    } catch (const std::bad_alloc &) {
        return nullptr;
    }
    // The slot's generation in the id tells the feed from an earlier one of
    // the slot whose engine subscription may still be calling.
    uint32_t id;
    void *place = m_feeds.Take(id);
    if (!place)
        return nullptr;
    Feed *feed = new (place) Feed();
    feed->id = id;
    feed->hash = hash;
    feed->check = check;
    // Another live feed of a URL with the same hash keeps its place (room
    // was made above).
    m_feedOfUrl.Insert(id, hash);
    return feed;
}

bool NodeSession::Join(Feed &feed, uint32_t id)
{
    // The membership first: it is what can fail for want of memory.
    Membership *membership;
    try {
        membership = m_memberships.PlaceSlotOf(id);
        if (!membership)
            return false;
        AddMember(feed, id);
    } catch (const std::bad_alloc &) {
        return false;
    }
    *membership = {feed.id, MemberCount(feed) - 1};
    // A newcomer hears what a new subscription would: the statuses since
    // "connecting", and once subscribed, the attributes and the value.
    for (uint8_t i = 0; i < feed.statusCount; ++i)
        m_queue.Push(wire::Kind::Status, [&](wire::Out &out) {
            out.U32(id);
            out.U32(feed.statuses[i]);
        });
    if (feed.statusCount && feed.statuses[feed.statusCount - 1] == kCadroStatusSubscribed) {
        if (feed.Has(Feed::kHasAttributes))
            m_queue.Push(wire::Kind::Attributes, [&](wire::Out &out) {
                out.U32(id);
                out.Attributes(AttributesOf(feed));
            });
        WithCurrentData(feed, [&](std::string_view fields) { m_queue.PushId(wire::Kind::Data, fields, id); });
    }
    m_queue.Push(wire::Kind::Joined, [&](wire::Out &out) {
        out.U32(id);
        out.U32(feed.id);
    });
    return true;
}

CadroDataItem *NodeSession::Leave(uint32_t id)
{
    Membership *found = MembershipOf(id);
    if (!found)
        return nullptr;
    Membership membership = std::exchange(*found, Membership());
    Feed *feed = FeedOf(membership.feed);
    uint32_t count = MemberCount(*feed);
    if (membership.index + 1 < count) {
        uint32_t last = MemberAt(*feed, count - 1);
        MemberAt(*feed, membership.index) = last;
        if (Membership *moved = m_memberships.AtSlotOf(last))
            moved->index = membership.index;
    }
    RemoveLastMember(*feed);
    if (feed->first != 0)
        return nullptr;
    CadroDataItem *item = feed->item;
    feed->item = nullptr;
    DropFeed(*feed);
    return item;
}

void NodeSession::DropFeed(Feed &feed)
{
    ForEachMember(feed, [&](uint32_t member) {
        Membership *membership = m_memberships.AtSlotOf(member);
        if (membership && membership->feed == feed.id)
            *membership = Membership();
    });
    m_moreMembers.erase(feed.id);
    Unshare(feed);
    uint32_t id = feed.id;
    m_feeds.Leave(id);
    feed.~Feed();
    m_feeds.Give(id);
}

void NodeSession::Unsubscribe(uint32_t id)
{
    CadroDataItem *item;
    {
        std::lock_guard<SlimMutex> l(m_feedsLock);
        item = Leave(id);
    }
    if (item)
        item->Release(); // waits for its callbacks, which take the lock
}

CadroDataItem *NodeSession::Find(uint32_t id)
{
    std::lock_guard<SlimMutex> l(m_feedsLock);
    Membership *membership = MembershipOf(id);
    Feed *feed = membership ? FeedOf(membership->feed) : nullptr;
    if (!feed || !feed->item)
        return nullptr;
    feed->item->AddRef();
    return feed->item;
}

Membership *NodeSession::MembershipOf(uint32_t id)
{
    return Occupant(id) == id ? m_memberships.AtSlotOf(id) : nullptr;
}

uint32_t NodeSession::Occupant(uint32_t id)
{
    Membership *membership = m_memberships.AtSlotOf(id);
    Feed *feed = membership ? FeedOf(membership->feed) : nullptr;
    if (!feed || membership->index >= MemberCount(*feed))
        return 0;
    return MemberAt(*feed, membership->index);
}

CadroAttributes NodeSession::AttributesOf(const Feed &feed)
{
    CadroAttributes attributes = {};
    attributes.mask = feed.attributeMask;
    attributes.access = feed.access;
    attributes.dataType = feed.dataType;
    return attributes;
}

void NodeSession::List(uint32_t request, const std::wstring &url)
{
    std::vector<BrowseEntry> entries;
    bool found = m_engine.Browse(url, entries, m_fromNode);
    Reply([&](wire::Out &out) {
        out.U32(request);
        out.U8(found ? 1 : 0);
        out.U32(static_cast<uint32_t>(entries.size()));
        for (const BrowseEntry &e : entries) {
            out.Text(e.name);
            out.U16(e.kind);
            out.U8(e.leaf ? 1 : 0);
            out.U16(e.dataType);
            out.U16(e.access);
            // Whether the member's URL as a library would build it from this
            // listing names it: the library may then subscribe to it without
            // waiting for the node's answer.
            // (A local object's listing knows it for nearly every member.)
            out.U8(e.leaf && (e.named || m_engine.HasMember(wire::MemberUrl(url, e.name))) ? 1 : 0);
        }
    });
}

void NodeSession::Finish()
{
    m_finishing = true;
    m_queue.Push(wire::Kind::Closing, [](wire::Out &) {});
    m_queue.CloseWhenWritten();
}

void NodeSession::TopologyChanged()
{
    {
        // A running feed keeps the member it subscribed to (a network that
        // was loaded since may have a new one under its URL): a newcomer
        // subscribes anew, as a subscription of its own would.
        std::lock_guard<SlimMutex> l(m_feedsLock);
        m_feedOfUrl.Clear();
    }
    m_queue.Push(wire::Kind::Topology, [](wire::Out &) {});
}

HRESULT STDMETHODCALLTYPE NodeSession::OnData(void *cookie, uint32_t flags, const CadroValue *value, int32_t errorFlag,
                                              uint32_t timeLow, uint32_t timeHigh)
{
    // A single value (a write's, or a subscription's first): the same path
    // as a tick's, the table held alone for it.
    std::lock_guard<SlimMutex> l(m_feedsLock);
    TakeData(
        1, [&](size_t) { return IdOf(cookie); },
        [&](size_t, auto use) { WithFields(flags, *value, errorFlag, timeLow, timeHigh, use); });
    return S_OK;
}

void NodeSession::OnDataBatch(const DataEntry *entries, size_t count)
{
    constexpr uint32_t kFlags = kCadroHasValue | kCadroHasQuality | kCadroHasTime;
    std::lock_guard<SlimMutex> l(m_feedsLock);
    TakeData(
        count, [&](size_t i) { return IdOf(entries[i].cookie); },
        [&](size_t i, auto use) {
            const DataEntry &e = entries[i];
            WithFields(kFlags, *e.value, e.error, e.low, e.high, use);
        });
}

template <class FeedIdOf, class FieldsOf> void NodeSession::TakeData(size_t count, FeedIdOf feedIdOf, FieldsOf fieldsOf)
{
    auto each = [&](auto take) {
        for (size_t i = 0; i < count; ++i) {
            if (i + kPrefetchAhead < count) {
                if (const void *ahead = m_feeds.Where(feedIdOf(i + kPrefetchAhead)))
                    PrefetchObject(ahead);
            }
            if (Feed *feed = FeedOf(feedIdOf(i)))
                fieldsOf(i, [&](std::string_view fields) {
                    feed->Set(Feed::kHasData, true);
                    take(*feed, fields);
                });
        }
    };
    if (m_queue.Backlog() > kBehindBacklog) {
        each([&](Feed &feed, std::string_view) { Hold(feed); });
        return;
    }
    m_queue.PushIds([&](auto push) {
        PushHeld(push);
        // Feeds that get one value one after the other share one frame.
        each([&](Feed &feed, std::string_view fields) { push(wire::Kind::FeedData, fields, feed.id); });
    });
}

void NodeSession::Hold(Feed &feed)
{
    if (feed.Has(Feed::kHeld))
        return;
    feed.Set(Feed::kHeld, true);
    m_held.push_back(feed.id);
    m_holding = true;
}

template <class Push> void NodeSession::PushHeld(Push &push)
{
    if (m_held.empty())
        return;
    size_t waiting = 0; // feeds not yet given their subscription stay held
    for (uint32_t id : m_held) {
        Feed *feed = FeedOf(id); // gone meanwhile: nothing to send
        if (!feed || !feed->Has(Feed::kHeld))
            continue;
        if (!feed->item) {
            m_held[waiting++] = id;
            continue;
        }
        WithCurrentData(*feed, [&](std::string_view fields) { push(wire::Kind::FeedData, fields, feed->id); });
        feed->Set(Feed::kHeld, false);
    }
    m_held.resize(waiting);
    m_holding = waiting != 0;
}

void NodeSession::SendHeld()
{
    if (!m_holding.load())
        return;
    std::lock_guard<SlimMutex> l(m_feedsLock);
    if (m_queue.Backlog() <= kBehindBacklog)
        m_queue.PushIds([&](auto push) { PushHeld(push); });
}

HRESULT STDMETHODCALLTYPE NodeSession::OnAttributes(void *cookie, const CadroAttributes *attributes)
{
    std::lock_guard<SlimMutex> l(m_feedsLock);
    Feed *feed = FeedOf(IdOf(cookie));
    if (!feed)
        return S_OK;
    feed->Set(Feed::kHasAttributes, true);
    feed->attributeMask = static_cast<uint8_t>(attributes->mask);
    feed->access = static_cast<uint8_t>(attributes->access);
    feed->dataType = attributes->dataType;
    m_queue.Push(wire::Kind::FeedAttributes, [&](wire::Out &out) {
        out.U32(feed->id);
        out.Attributes(*attributes);
    });
    return S_OK;
}

HRESULT STDMETHODCALLTYPE NodeSession::StatusChange(void *cookie, uint32_t status, uint32_t, uint32_t)
{
    std::lock_guard<SlimMutex> l(m_feedsLock);
    Feed *feed = FeedOf(IdOf(cookie));
    if (!feed)
        return S_OK;
    if (status == kCadroStatusConnecting || status == kCadroStatusDisconnected) {
        // A newcomer to a machine that is away is told only that it is
        // being connected to, and is given no value until it is back.
        feed->statuses[0] = kCadroStatusConnecting;
        feed->statusCount = 1;
        feed->Set(Feed::kHasData, false);
    } else if (feed->statusCount < sizeof feed->statuses) {
        feed->statuses[feed->statusCount++] = static_cast<uint8_t>(status);
    }
    if (status == kCadroStatusSubscribeFailed && !feed->Has(Feed::kDead)) {
        feed->Set(Feed::kDead, true); // the member has gone: a newcomer asks the engine again
        Unshare(*feed);
    }
    m_queue.Push(wire::Kind::FeedStatus, [&](wire::Out &out) {
        out.U32(feed->id);
        out.U32(status);
    });
    return S_OK;
}

} // namespace cadrosim

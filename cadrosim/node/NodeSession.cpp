#include "NodeSession.h"

#include "Prefetch.h"
#include "SimValue.h"

#include <cstring>
#include <new>
#include <shared_mutex>
#include <vector>

namespace cadrosim {

namespace {
// The key of a URL's hash in the table of feeds (0 marks a free slot there;
// the feed's second hash decides).
uint64_t UrlKey(uint64_t hash)
{
    return hash ? hash : 1;
}

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
    m_queue.Attach(m_channel);
    m_reader = std::thread([this] { ReadLoop(); });
}

void NodeSession::Join()
{
    if (m_reader.joinable())
        m_reader.join();
}

template <class Fill> void NodeSession::Reply(Fill fill)
{
    m_queue.Push(wire::Kind::Reply, fill);
    m_queue.Flush();
}

void NodeSession::ReadLoop()
{
    std::string buffer;
    size_t consumed = 0;
    bool fine = true;
    while (fine && m_channel->Read(buffer))
        fine = wire::TakeFrames(buffer, consumed, [&](wire::Kind kind, wire::In in) {
            if (fine)
                fine = Handle(kind, in);
        });
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
        for (auto &feed : m_feeds)
            if (feed && feed->item)
                items.push_back(feed->item);
        m_feeds.clear();
        m_freeFeeds.clear();
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
    if (id == kNoMember) {
        if (request)
            Reply([&](wire::Out &out) {
                out.U32(request);
                out.U32(static_cast<uint32_t>(E_INVALIDARG));
            });
        return;
    }
    Unsubscribe(id); // an id used twice: the later subscription wins
    HRESULT hr = S_OK;
    uint32_t fresh = 0; // a new feed, to subscribe on the engine
    {
        std::lock_guard<SlimMutex> l(m_feedsLock);
        uint64_t hash = wire::UrlHash(url), check = wire::UrlCheck(url);
        Feed *feed = SharedFeed(hash, check);
        if (!feed) {
            feed = NewFeed(hash, check);
            fresh = feed ? feed->id : 0;
        }
        if (feed)
            Join(*feed, id);
        else
            hr = E_OUTOFMEMORY;
    }
    if (fresh) {
        // Outside the lock: the engine may answer at once, from this thread.
        CadroDataItem *item = nullptr;
        hr = m_engine.Subscribe(url.c_str(), CookieOf(fresh), this, &item, m_fromNode, this);
        std::unique_lock<SlimMutex> l(m_feedsLock);
        Feed *feed = FeedOf(fresh);
        if (feed && SUCCEEDED(hr)) {
            feed->item = item;
            item = nullptr;
        } else if (feed) {
            DropFeed(*feed);
        }
        l.unlock();
        if (item)
            item->Release();
    }
    if (request)
        Reply([&](wire::Out &out) {
            out.U32(request);
            out.U32(static_cast<uint32_t>(hr));
        });
}

NodeSession::Feed *NodeSession::FeedOf(uint32_t feedId)
{
    uint32_t slot = wire::FeedSlot(feedId);
    if (slot >= m_feeds.size() || !m_feeds[slot] || m_feeds[slot]->id != feedId)
        return nullptr;
    return m_feeds[slot].get();
}

NodeSession::Feed *NodeSession::SharedFeed(uint64_t hash, uint64_t check)
{
    uint32_t *indexed = m_feedOfUrl.Find(UrlKey(hash));
    Feed *feed = indexed ? FeedOf(*indexed) : nullptr;
    return feed && feed->check == check ? feed : nullptr;
}

void NodeSession::Unshare(Feed &feed)
{
    uint32_t *indexed = m_feedOfUrl.Find(UrlKey(feed.hash));
    if (indexed && *indexed == feed.id)
        m_feedOfUrl.Erase(UrlKey(feed.hash));
}

void NodeSession::LastData::Assign(std::string_view fields)
{
    if (fields.size() <= sizeof m_short) {
        memcpy(m_short, fields.data(), fields.size());
        m_size = static_cast<uint8_t>(fields.size());
        m_long.reset();
    } else {
        m_size = 0;
        if (m_long)
            m_long->assign(fields);
        else
            m_long = std::make_unique<std::string>(fields);
    }
}

void NodeSession::FeedMembers::Add(uint32_t id)
{
    if (m_count++ == 0) {
        m_first = id;
        return;
    }
    if (!m_more)
        m_more = std::make_unique<std::vector<uint32_t>>();
    m_more->push_back(id);
}

void NodeSession::FeedMembers::RemoveLast()
{
    if (m_count == 0)
        return;
    if (--m_count == 0)
        return;
    m_more->pop_back();
    if (m_more->empty())
        m_more.reset();
}

NodeSession::Feed *NodeSession::NewFeed(uint64_t hash, uint64_t check)
{
    uint32_t slot;
    if (!m_freeFeeds.empty()) {
        slot = m_freeFeeds.back();
        m_freeFeeds.pop_back();
    } else {
        if (m_feeds.size() >= wire::kFeedSlotMask)
            return nullptr;
        slot = static_cast<uint32_t>(m_feeds.size());
        m_feeds.emplace_back();
        m_feedGenerations.push_back(0);
    }
    auto feed = std::make_unique<Feed>();
    // The generation tells the feed from an earlier one of the slot whose
    // engine subscription may still be calling.
    feed->id = (static_cast<uint32_t>(++m_feedGenerations[slot] & 0x7ff) << wire::kFeedSlotBits) | (slot + 1);
    feed->hash = hash;
    feed->check = check;
    // A stale entry (its feed gone) is replaced; a live one of another URL
    // with the same hash is kept.
    uint32_t &indexed = m_feedOfUrl[UrlKey(hash)];
    if (!FeedOf(indexed))
        indexed = feed->id;
    m_feeds[slot] = std::move(feed);
    return m_feeds[slot].get();
}

void NodeSession::Join(Feed &feed, uint32_t id)
{
    // A newcomer hears what a new subscription would: the statuses since
    // "connecting", and once subscribed, the attributes and the value.
    for (uint8_t i = 0; i < feed.statusCount; ++i)
        m_queue.Push(wire::Kind::Status, [&](wire::Out &out) {
            out.U32(id);
            out.U32(feed.statuses[i]);
        });
    if (feed.statusCount && feed.statuses[feed.statusCount - 1] == kCadroStatusSubscribed) {
        if (feed.hasAttributes)
            m_queue.Push(wire::Kind::Attributes, [&](wire::Out &out) {
                out.U32(id);
                out.Attributes(feed.attributes);
            });
        if (!feed.data.Empty())
            m_queue.PushId(wire::Kind::Data, feed.data.View(), id);
    }
    m_queue.Push(wire::Kind::Joined, [&](wire::Out &out) {
        out.U32(id);
        out.U32(feed.id);
    });
    m_memberships[id] = {feed.id, feed.members.Size()};
    feed.members.Add(id);
}

CadroDataItem *NodeSession::Leave(uint32_t id)
{
    Membership *found = m_memberships.Find(id);
    if (!found)
        return nullptr;
    Membership membership = *found;
    m_memberships.Erase(id);
    Feed *feed = FeedOf(membership.feed);
    if (!feed)
        return nullptr;
    FeedMembers &members = feed->members;
    if (membership.index + 1 < members.Size()) {
        members[membership.index] = members[members.Size() - 1];
        m_memberships[members[membership.index]].index = membership.index;
    }
    members.RemoveLast();
    if (members.Size() > 0)
        return nullptr;
    CadroDataItem *item = feed->item;
    feed->item = nullptr;
    DropFeed(*feed);
    return item;
}

void NodeSession::DropFeed(Feed &feed)
{
    feed.members.ForEach([&](uint32_t member) { m_memberships.Erase(member); });
    Unshare(feed);
    uint32_t slot = wire::FeedSlot(feed.id);
    m_feeds[slot].reset();
    m_freeFeeds.push_back(slot);
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
    Membership *membership = m_memberships.Find(id);
    Feed *feed = membership ? FeedOf(membership->feed) : nullptr;
    if (!feed || !feed->item)
        return nullptr;
    feed->item->AddRef();
    return feed->item;
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
    WithFields(flags, *value, errorFlag, timeLow, timeHigh, [&](std::string_view fields) {
        // Values come from every shard at once: they share the table and
        // take only their feed's own lock (a newcomer's replay holds the
        // table alone).
        std::shared_lock<SlimMutex> l(m_feedsLock);
        Feed *feed = FeedOf(IdOf(cookie));
        if (!feed)
            return;
        std::lock_guard<SlimMutex> fl(feed->lock);
        feed->data.Assign(fields);
        // Feeds that get one value one after the other share one frame.
        m_queue.PushId(wire::Kind::FeedData, fields, feed->id);
    });
    return S_OK;
}

void NodeSession::OnDataBatch(const DataEntry *entries, size_t count)
{
    constexpr uint32_t kFlags = kCadroHasValue | kCadroHasQuality | kCadroHasTime;
    std::lock_guard<SlimMutex> l(m_feedsLock);
    const bool behind = m_queue.Backlog() > kBehindBacklog;
    // A feed's place in the table is asked for before the feed.
    auto slotOf = [&](size_t i) { return wire::FeedSlot(IdOf(entries[i].cookie)); };
    auto each = [&](auto take) {
        for (size_t i = 0; i < count; ++i) {
            if (i + 2 * kPrefetchAhead < count && slotOf(i + 2 * kPrefetchAhead) < m_feeds.size())
                __builtin_prefetch(&m_feeds[slotOf(i + 2 * kPrefetchAhead)]);
            if (i + kPrefetchAhead < count && slotOf(i + kPrefetchAhead) < m_feeds.size())
                PrefetchObject(m_feeds[slotOf(i + kPrefetchAhead)].get());
            const DataEntry &e = entries[i];
            if (Feed *feed = FeedOf(IdOf(e.cookie)))
                WithFields(kFlags, *e.value, e.error, e.low, e.high, [&](std::string_view fields) {
                    feed->data.Assign(fields);
                    take(*feed, fields);
                });
        }
    };
    if (behind) {
        each([&](Feed &feed, std::string_view) { Hold(feed); });
        return;
    }
    m_queue.PushIds([&](auto push) {
        PushHeld(push);
        each([&](Feed &feed, std::string_view fields) { push(wire::Kind::FeedData, fields, feed.id); });
    });
}

void NodeSession::Hold(Feed &feed)
{
    if (feed.held)
        return;
    feed.held = true;
    m_held.push_back(feed.id);
    m_holding = true;
}

template <class Push> void NodeSession::PushHeld(Push &push)
{
    if (m_held.empty())
        return;
    for (uint32_t id : m_held) {
        Feed *feed = FeedOf(id); // gone meanwhile: nothing to send
        if (feed && feed->held && !feed->data.Empty())
            push(wire::Kind::FeedData, feed->data.View(), feed->id);
        if (feed)
            feed->held = false;
    }
    m_held.clear();
    m_holding = false;
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
    feed->hasAttributes = true;
    feed->attributes = *attributes;
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
        feed->data.Clear();
    } else if (feed->statusCount < sizeof feed->statuses) {
        feed->statuses[feed->statusCount++] = static_cast<uint8_t>(status);
    }
    if (status == kCadroStatusSubscribeFailed && !feed->dead) {
        feed->dead = true; // the member has gone: a newcomer asks the engine again
        Unshare(*feed);
    }
    m_queue.Push(wire::Kind::FeedStatus, [&](wire::Out &out) {
        out.U32(feed->id);
        out.U32(status);
    });
    return S_OK;
}

} // namespace cadrosim

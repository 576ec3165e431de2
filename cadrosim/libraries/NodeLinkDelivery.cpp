// What the node sends: values in batches, statuses, attributes, joins and
// changes of the network, delivered to the subscriptions.
#include "NodeLinkParts.h"

#include "Prefetch.h"
#include "SimValue.h"

namespace cadrosim {
using namespace link; // the link's own limits and waits

void NodeLink::TakeData(wire::In &in, bool feeds)
{
    Batch::Fields f;
    f.flags = in.U32();
    in.Value(f.value);
    f.error = static_cast<int32_t>(in.U32());
    f.low = in.U32();
    f.high = in.U32();
    auto index = static_cast<uint32_t>(m_batch.fields.size());
    m_batch.fields.push_back(f);
    uint32_t tagged = index | (feeds ? kFeedBit : 0);
    while (in.Ok() && !in.AtEnd()) {
        uint32_t id = in.U32();
        if (in.Ok())
            m_batch.ids.emplace_back(id, tagged);
    }
}

void NodeLink::PrefetchFeed(size_t i) const
{
    // The feed's place in the table a few entries before the feed itself.
    auto slotOf = [&](size_t at) { return wire::FeedSlot(m_batch.ids[at].first); };
    if (i + kPrefetchAhead < m_batch.ids.size() && (m_batch.ids[i + kPrefetchAhead].second & kFeedBit) &&
        slotOf(i + kPrefetchAhead) < m_feeds.size())
        __builtin_prefetch(&m_feeds[slotOf(i + kPrefetchAhead)]);
    if (i < m_batch.ids.size() && (m_batch.ids[i].second & kFeedBit) && slotOf(i) < m_feeds.size())
        PrefetchObject(m_feeds[slotOf(i)]);
}

void NodeLink::DeliverData()
{
    if (m_batch.fields.empty())
        return;
    std::unique_lock<SlimMutex> l(m_lock);
    m_delivering = true;
    for (size_t next = 0; next < m_batch.ids.size();) {
        next = GatherCalls(next);
        l.unlock();
        MakeGatheredCalls();
        l.lock();
    }
    m_delivering = false;
    std::vector<RemoteSubscription *> graveyard;
    graveyard.swap(m_graveyard);
    l.unlock();
    for (RemoteSubscription *sub : graveyard)
        sub->Unpin();
    for (Batch::Fields &f : m_batch.fields)
        ClearCadroValue(f.value);
    m_batch.fields.clear();
    m_batch.ids.clear();
}

size_t NodeLink::GatherCalls(size_t from)
{
    size_t i = from;
    for (; i < m_batch.ids.size() && m_batch.subs.size() < kCallsPerRound; ++i) {
        PrefetchFeed(i + kPrefetchAhead);
        auto [id, tagged] = m_batch.ids[i];
        uint32_t index = tagged & ~kFeedBit;
        const Batch::Fields &f = m_batch.fields[index];
        if (tagged & kFeedBit) {
            // A feed's value: remembered once, for all its members.
            if (LinkFeed *feed = FeedOf(id)) {
                feed->mirror.Remember(f.flags, f.value, f.error, f.low, f.high);
                ForEachMember(*feed, [&](RemoteSubscription *sub) { m_batch.subs.emplace_back(sub, index); });
            }
        } else if (RemoteSubscription *sub = Lookup(id)) {
            sub->feed->mirror.Remember(f.flags, f.value, f.error, f.low, f.high);
            m_batch.subs.emplace_back(sub, index);
        }
    }
    return i;
}

void NodeLink::MakeGatheredCalls()
{
    // No pins: a subscription let go during the batch is deleted after it
    // (Forget), and the one being called is published first, so that its
    // holder either is seen here or sees the call and waits for it.
    // Two steps ahead: the subscription, then (once it has arrived) what
    // its cookie points at, which is most often the holder's own object for
    // the value (a prefetch of any address is harmless).
    const size_t count = m_batch.subs.size();
    for (size_t i = 0; i < count; ++i) {
        if (i + 2 * kPrefetchAhead < count)
            PrefetchObject(m_batch.subs[i + 2 * kPrefetchAhead].first);
        if (i + kPrefetchAhead < count)
            __builtin_prefetch(m_batch.subs[i + kPrefetchAhead].first->cookie);
        auto [sub, index] = m_batch.subs[i];
        m_callingSub.store(sub);
        if (!sub->IsForgotten()) {
            const Batch::Fields &f = m_batch.fields[index];
            ReceiverAt(sub->ReceiverPlace())->OnData(sub->cookie, f.flags, &f.value, f.error, f.low, f.high);
        }
        if (m_callWaiters.load() != 0)
            WakeWaiters(nullptr);
    }
    WakeWaiters(nullptr);
    m_batch.subs.clear();
}

void NodeLink::WakeWaiters(RemoteSubscription *calling)
{
    m_callingSub.store(calling);
    if (m_callWaiters.load() == 0)
        return;
    // Under the lock, so that a holder between its check and its sleep
    // cannot miss the wake.
    m_lock.lock();
    m_lock.unlock();
    m_callReturned.notify_all();
}

void NodeLink::Dispatch(wire::Kind kind, wire::In &in)
{
    if (kind == wire::Kind::Data || kind == wire::Kind::FeedData) {
        TakeData(in, kind == wire::Kind::FeedData);
        return;
    }
    DeliverData(); // what came before this frame, first
    switch (kind) {
    case wire::Kind::Attributes: {
        uint32_t id = in.U32();
        CadroAttributes a = in.Attributes();
        if (in.Ok())
            CallSubscription(id, [&](RemoteSubscription &sub) { sub.Receiver()->OnAttributes(sub.cookie, &a); });
        return;
    }
    case wire::Kind::Status: {
        uint32_t id = in.U32();
        uint32_t status = in.U32();
        if (in.Ok())
            CallSubscription(
                id, [&](RemoteSubscription &sub) { sub.Receiver()->StatusChange(sub.cookie, status, 0, 0); },
                [&](RemoteSubscription &sub) { sub.feed->mirror.RememberStatus(status); });
        return;
    }
    case wire::Kind::Joined: {
        uint32_t id = in.U32();
        uint32_t feedId = in.U32();
        std::lock_guard<SlimMutex> l(m_lock);
        if (in.Ok())
            Join(id, feedId);
        return;
    }
    case wire::Kind::FeedAttributes: {
        uint32_t feedId = in.U32();
        CadroAttributes a = in.Attributes();
        if (in.Ok())
            CallFeed(
                feedId, [&](RemoteSubscription &sub) { sub.Receiver()->OnAttributes(sub.cookie, &a); },
                [](LinkFeed &) {});
        return;
    }
    case wire::Kind::FeedStatus: {
        uint32_t feedId = in.U32();
        uint32_t status = in.U32();
        if (in.Ok())
            CallFeed(
                feedId, [&](RemoteSubscription &sub) { sub.Receiver()->StatusChange(sub.cookie, status, 0, 0); },
                [&](LinkFeed &feed) { feed.mirror.RememberStatus(status); });
        return;
    }
    case wire::Kind::Reply: {
        uint32_t request = in.U32();
        {
            std::lock_guard<SlimMutex> l(m_lock);
            auto it = m_pending.find(request);
            if (it == m_pending.end())
                return;
            it->second->reply = in.Rest();
            it->second->answered = true;
            it->second->Finish();
            m_pending.erase(it);
        }
        return;
    }
    case wire::Kind::Topology:
        TopologyChanged();
        return;
    case wire::Kind::Closing: {
        std::lock_guard<SlimMutex> l(m_lock);
        m_mayStartNode = false; // shut down on purpose: wait for a new one
        return;
    }
    default:
        return;
    }
}

void NodeLink::TopologyChanged()
{
    std::vector<ICadroBrowserReceiver *> receivers;
    {
        std::lock_guard<SlimMutex> l(m_lock);
        m_known.Forget();
        receivers = m_browserReceivers;
        for (auto *r : receivers)
            r->AddRef();
    }
    m_changed.notify_all(); // subscribers waiting for a catalogue now out of date
    for (auto *r : receivers) {
        r->BrowseItemChanged();
        r->Release();
    }
}

} // namespace cadrosim

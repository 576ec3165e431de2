// The link's tables: its subscriptions by id, and the feeds of the node
// they share.
#include "NodeLinkParts.h"

#include <new>

namespace cadrosim {
using namespace link; // the link's own limits and waits

RemoteSubscription *NodeLink::NewSubscription(ICadroRealTimeReceiver *receiver, void *cookie)
{
    uint32_t id;
    void *place = m_subs.Take(id);
    if (!place)
        return nullptr;
    auto *sub = new (place) RemoteSubscription(m_index, receiver, cookie);
    sub->id = id;
    return sub;
}

void NodeLink::Destroy(RemoteSubscription *sub)
{
    const uint32_t id = sub->id;
    ICadroRealTimeReceiver *receiver = sub->receiver;
    sub->~RemoteSubscription();
    {
        std::lock_guard<SlimMutex> l(m_lock);
        m_subs.Give(id);
    }
    // Outside the lock: the receiver's last reference may end its owner,
    // which may call the library again.
    receiver->Release();
    ReleaseUse();
}

LinkFeed *NodeLink::FeedOf(uint32_t feedId) const
{
    uint32_t slot = wire::FeedSlot(feedId);
    if (slot >= m_feeds.size() || !m_feeds[slot] || m_feeds[slot]->id != feedId)
        return nullptr;
    return m_feeds[slot];
}

void NodeLink::Join(uint32_t id, uint32_t feedId)
{
    RemoteSubscription *sub = Lookup(id);
    uint32_t slot = wire::FeedSlot(feedId);
    if (!sub || slot == UINT32_MAX || slot >= wire::kFeedSlotMask || sub->feed->id == feedId)
        return;
    if (slot >= m_feeds.size())
        m_feeds.resize(slot + 1, nullptr);
    LinkFeed *&feed = m_feeds[slot];
    if (feed && feed->id != feedId) {
        // An earlier feed of the slot that the node has dropped.
        Unshare(*feed);
        feed = nullptr;
    }
    LinkFeed *current = sub->feed;
    if (!feed && current->id == 0 && current->first == sub && current->Alone()) {
        // Its own feed becomes the node's: what the node told the newcomer
        // is the feed's state now. (Nearly every URL goes this way.)
        current->id = feedId;
        feed = current;
        return;
    }
    if (!feed) {
        feed = LinkFeed::CopyOf(*current);
        if (!feed)
            return; // the subscription goes on in the feed it has
        feed->id = feedId;
    }
    LinkFeed &joined = *feed;
    // Room first: short of memory, the subscription stays where it is.
    if (!MakeRoom(joined))
        return;
    RemoveMember(sub);
    AddMember(joined, sub);
}

bool NodeLink::MakeRoom(LinkFeed &feed)
{
    if (!feed.first)
        return true;
    try {
        if (!feed.others)
            feed.others = std::make_unique<std::vector<RemoteSubscription *>>();
        // Doubled when full: room for just one more each time would copy the
        // whole array at every join, and thousands of items may follow one
        // member.
        std::vector<RemoteSubscription *> &others = *feed.others;
        if (others.size() == others.capacity())
            others.reserve(std::max<size_t>(4, others.capacity() * 2));
    } catch (const std::bad_alloc &) {
        return false;
    }
    return true;
}

void NodeLink::AddMember(LinkFeed &feed, RemoteSubscription *sub)
{
    if (feed.first) {
        feed.others->push_back(sub);
        sub->place = static_cast<uint32_t>(feed.others->size());
    } else {
        feed.first = sub;
        sub->place = 0;
    }
    sub->feed = &feed;
}

void NodeLink::RemoveMember(RemoteSubscription *sub)
{
    LinkFeed *feed = sub->feed;
    if (!feed)
        return;
    sub->feed = nullptr;
    // The last of the others takes the place that comes free.
    RemoteSubscription *last = feed->Alone() ? nullptr : feed->others->back();
    if (last)
        feed->others->pop_back();
    if (sub->place == 0)
        feed->first = last;
    else if (last != sub)
        (*feed->others)[sub->place - 1] = last;
    if (last && last != sub)
        last->place = sub->place;
    if (feed->first)
        return;
    if (feed->id != 0)
        m_feeds[wire::FeedSlot(feed->id)] = nullptr;
    delete feed;
}

void NodeLink::Unshare(LinkFeed &feed)
{
    // The first member keeps the feed, the others take copies (they share
    // it still when memory is short).
    feed.id = 0;
    while (!feed.Alone()) {
        LinkFeed *own = LinkFeed::CopyOf(feed);
        if (!own)
            return;
        RemoteSubscription *sub = feed.others->back();
        RemoveMember(sub);
        AddMember(*own, sub);
    }
}

void NodeLink::DropFeeds()
{
    for (LinkFeed *feed : m_feeds)
        if (feed)
            Unshare(*feed);
    m_feeds.clear();
}

} // namespace cadrosim

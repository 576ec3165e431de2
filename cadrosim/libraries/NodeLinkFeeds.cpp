// The link's tables: its subscriptions by id, and the feeds of the node
// they share.
#include "NodeLinkParts.h"

#include <new>

namespace cadrosim {
using namespace link; // the link's own limits and waits

RemoteSubscription *NodeLink::NewSubscription(ICadroRealTimeReceiver *receiver, void *cookie)
{
    uint8_t receiverPlace;
    if (!TakeReceiverPlace(receiver, receiverPlace))
        return nullptr;
    uint32_t id;
    void *place = m_subs.Take(id);
    if (!place) {
        GiveReceiverPlace(receiverPlace);
        return nullptr;
    }
    auto *sub = new (place) RemoteSubscription(m_index, receiverPlace, cookie);
    sub->id = id;
    return sub;
}

bool NodeLink::TakeReceiverPlace(ICadroRealTimeReceiver *receiver, uint8_t &place)
{
    size_t free = kMostReceivers;
    for (size_t i = 0; i < kMostReceivers; ++i) {
        if (m_receivers[i].receiver == receiver) {
            free = i;
            break;
        }
        if (!m_receivers[i].receiver && free == kMostReceivers)
            free = i;
    }
    if (free == kMostReceivers)
        return false;
    m_receivers[free].receiver = receiver;
    ++m_receivers[free].subscriptions;
    place = static_cast<uint8_t>(free);
    return true;
}

ICadroRealTimeReceiver *NodeLink::GiveReceiverPlace(uint8_t place)
{
    ReceiverPlace &p = m_receivers[place];
    ICadroRealTimeReceiver *receiver = p.receiver;
    if (--p.subscriptions == 0)
        p.receiver = nullptr;
    return receiver;
}

void NodeLink::Destroy(RemoteSubscription *sub)
{
    const uint32_t id = sub->id;
    const uint8_t receiverPlace = sub->ReceiverPlace();
    sub->~RemoteSubscription();
    ICadroRealTimeReceiver *receiver;
    {
        std::lock_guard<SlimMutex> l(m_lock);
        m_subs.Give(id);
        receiver = GiveReceiverPlace(receiverPlace);
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
    if (!feed && current->id == 0 && current->Alone()) {
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
    RemoveMember(sub);
    AddMember(*feed, sub);
}

void NodeLink::AddMember(LinkFeed &feed, RemoteSubscription *sub)
{
    if (RemoteSubscription *head = Lookup(feed.head))
        head->prev = sub->id;
    sub->prev = 0;
    sub->next = feed.head;
    feed.head = sub->id;
    ++feed.members;
    sub->feed = &feed;
}

void NodeLink::RemoveMember(RemoteSubscription *sub)
{
    LinkFeed *feed = sub->feed;
    if (!feed)
        return;
    sub->feed = nullptr;
    if (RemoteSubscription *before = Lookup(sub->prev))
        before->next = sub->next;
    else
        feed->head = sub->next;
    if (RemoteSubscription *after = Lookup(sub->next))
        after->prev = sub->prev;
    sub->prev = sub->next = 0;
    if (--feed->members != 0)
        return;
    if (feed->id != 0)
        m_feeds[wire::FeedSlot(feed->id)] = nullptr;
    delete feed;
}

void NodeLink::Unshare(LinkFeed &feed)
{
    // One member keeps the feed, the others take copies (they share
    // it still when memory is short).
    feed.id = 0;
    while (!feed.Alone()) {
        LinkFeed *own = LinkFeed::CopyOf(feed);
        if (!own)
            return;
        RemoteSubscription *sub = Lookup(feed.head);
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

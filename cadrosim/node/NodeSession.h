#pragma once
// One server process's connection to the network node: its subscriptions on
// the node's engine, the requests it sends and the callbacks it is sent,
// gathered into batches (whatever came while the last batch was written goes
// out in one write).
//
// The library's subscriptions to one URL share one subscription on the
// engine, a feed: a value goes to the library once, whatever the number of
// its items on that URL. A subscription that joins a running feed is first
// told what a new subscription would be (statuses since "connecting", the
// attributes, the value), in order with the feed's own frames.
#include "Engine.h"
#include "FlatMap.h"
#include "FrameQueue.h"
#include "Memberships.h"
#include "SlotTable.h"

#include <memory>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

namespace cadrosim {

class NodeSession : public CSimUnknown<ICadroRealTimeReceiver>, public BatchReceiver {
public:
    // Starts serving a connected library, or the node of another machine
    // (fromNode: it is served only the machines this node serves itself);
    // ended is signalled when it is done.
    static NodeSession *Start(Engine &engine, std::shared_ptr<Channel> channel, bool fromNode, HANDLE ended);
    // Tells the library that the node is closing, then ends the connection
    // (the session then lets go of its subscriptions).
    void Finish();
    // Ends the connection at once.
    void Close() { m_channel->Close(); }
    bool Ended() const { return m_ended; }
    // Waits for its threads; after Ended().
    void Join();
    // Tells the library that the topology changed.
    void TopologyChanged();
    // Bytes waiting for the library to read them (not counting a write
    // under way).
    size_t QueuedBytes() { return m_queue.Backlog(); }

    HRESULT STDMETHODCALLTYPE OnData(void *cookie, uint32_t flags, const CadroValue *value, int32_t errorFlag,
                                     uint32_t timeLow, uint32_t timeHigh) override;
    HRESULT STDMETHODCALLTYPE OnAttributes(void *cookie, const CadroAttributes *attributes) override;
    HRESULT STDMETHODCALLTYPE StatusChange(void *cookie, uint32_t status, uint32_t, uint32_t) override;
    // A tick's values: the table held alone for the batch (no feed lock
    // for each), and the queue's lock once.
    void OnDataBatch(const DataEntry *entries, size_t count) override;
    ICadroRealTimeReceiver *Receiver() override { return this; }

private:
    NodeSession(Engine &engine, std::shared_ptr<Channel> channel, bool fromNode, HANDLE ended);
    void ReadLoop();
    // A library on the node's pipe may ask first for shared rings: the
    // channel to go on with (null: the connection ends); buffer keeps what
    // was read and is still to be handled.
    std::shared_ptr<Channel> Greet(std::string &buffer);
    bool Handle(wire::Kind kind, wire::In &in);
    // A feed lives in the session's slot table, not in a heap block of its
    // own (a block's header and the pointer to it cost a fifth of it).
    // What a value reads and writes first, in the feed's first cache line.
    struct Feed {
        enum Flag : uint8_t {
            kHasAttributes = 1,
            kDead = 2,    // its member has gone: a newcomer makes a new feed
            kHeld = 4,    // a value not sent yet: the library is behind
            kHasData = 8, // a value came since the last "connecting"
            kMore = 16,   // members after the first, in m_moreMembers
        };
        uint32_t id;             // with its slot's generation: the engine's cookie
        uint32_t check;          // the URL's second hash (see hash)
        uint8_t statusCount : 3; // statuses since the last "connecting"
        uint8_t flags : 5;
        uint8_t statuses[6];
        // The attributes: the mask's and the access's low bytes (the network
        // sets no other bits) and the data type.
        uint8_t attributeMask;
        uint8_t access;
        uint16_t dataType;
        // The library's ids that share the feed: nearly always one, kept
        // here (0: none; a library's ids are never 0); any others in the
        // session's table of more members (a URL that one library
        // subscribed twice), so that a feed carries no pointer or count
        // for them.
        uint32_t first;
        // With check, the URL's hashes, 96 bits: URLs that agree on both are
        // taken as one (the URL itself is not kept: it would double the feed).
        uint64_t hash;
        CadroDataItem *item;

        bool Has(Flag flag) const { return (flags & flag) != 0; }
        void Set(Flag flag, bool on) { flags = on ? (flags | flag) : (flags & ~flag); }
    };
    static_assert(sizeof(Feed) <= 40, "a feed is a node's memory for each subscription");

    void Subscribe(wire::In &in);
    void Unsubscribe(uint32_t id);
    void List(uint32_t request, const std::wstring &url);
    CadroDataItem *Find(uint32_t id);
    // Under m_feedsLock: the membership of exactly this id, and the id that
    // has the slot of id (0: none).
    Membership *MembershipOf(uint32_t id);
    uint32_t Occupant(uint32_t id);
    static CadroAttributes AttributesOf(const Feed &feed);
    // Under m_feedsLock.
    Feed *FeedOf(uint32_t feedId) { return m_feeds.Find(feedId); }
    // The feed's members, under m_feedsLock. AddMember throws
    // std::bad_alloc, the members unchanged, when memory is short.
    uint32_t &MemberAt(Feed &feed, uint32_t index);
    uint32_t MemberCount(const Feed &feed);
    void AddMember(Feed &feed, uint32_t id);
    void RemoveLastMember(Feed &feed);
    template <class Each> void ForEachMember(const Feed &feed, Each each);
    // The member's value as its engine subscription has it now, the Data
    // fields given to use(fields): the feed keeps no copy of its last value
    // (a newcomer and a library that is behind are given the member's,
    // which is that one or newer). False when there is none.
    template <class Use> bool WithCurrentData(const Feed &feed, Use use);
    // Under m_feedsLock: each value (fieldsOf(i, use) calls use(fields))
    // stored in its feed and queued, or held in the feed while the library
    // is behind. feedIdOf(i) names the feeds to ask for ahead.
    template <class FeedIdOf, class FieldsOf> void TakeData(size_t count, FeedIdOf feedIdOf, FieldsOf fieldsOf);
    Feed *NewFeed(uint64_t hash, uint32_t check);
    // The running feed of the URL that a newcomer joins, if any.
    Feed *SharedFeed(uint64_t hash, uint32_t check);
    void Unshare(Feed &feed);
    // False, and nothing changed, when memory is short.
    bool Join(Feed &feed, uint32_t id);
    // Takes id out of its feed; the feed's engine subscription, for the
    // caller to release without the lock, when it was the last member.
    CadroDataItem *Leave(uint32_t id);
    // Forgets the feed and its members (its engine subscription is gone).
    void DropFeed(Feed &feed);
    // Under m_feedsLock held alone, while the library is behind: the feed's
    // newest value waits in the feed instead of the queue.
    void Hold(Feed &feed);
    // Under m_feedsLock held alone and the queue's lock: the newest value
    // of each feed held back (push is PushIds's).
    template <class Push> void PushHeld(Push &push);
    // The writer has caught up: the values held back go out.
    void SendHeld();
    // A reply: written by the reading thread itself, once it has handled
    // everything that one read brought.
    template <class Fill> void Reply(Fill fill);
    void ReleaseAll();

    Engine &m_engine;
    std::shared_ptr<Channel> m_channel;
    bool m_fromNode;
    HANDLE m_endedEvent;
    std::atomic<bool> m_ended{false};
    std::atomic<bool> m_finishing{false};
    SlimMutex m_feedsLock;
    // The feeds by id; the generation leaves an id's top bit clear.
    SlotTable<Feed, wire::kFeedSlotBits, 31 - wire::kFeedSlotBits> m_feeds;
    std::unordered_map<uint32_t, std::vector<uint32_t>> m_moreMembers; // by feed id: members after the first
    std::vector<uint32_t> m_held;                                      // feeds with a value held back
    std::atomic<bool> m_holding{false};
    // Shared feeds (their ids) by the URL's hash, which the index reads from
    // the feed; a URL whose hash another one has takes a feed that is not
    // found here (it is not shared).
    struct UrlHashOf {
        NodeSession *session;
        uint64_t operator()(uint32_t feedId) const { return session->m_feeds.Find(feedId)->hash; }
    };
    FlatIndex<UrlHashOf> m_feedOfUrl{UrlHashOf{this}};
    Memberships m_memberships;
    FrameQueue m_queue;
    bool m_replied = false; // the reading thread's: a reply waits to be written
    std::thread m_reader;
};

} // namespace cadrosim

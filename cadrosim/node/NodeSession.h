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

private:
    NodeSession(Engine &engine, std::shared_ptr<Channel> channel, bool fromNode, HANDLE ended);
    void ReadLoop();
    // A library on the node's pipe may ask first for shared rings: the
    // channel to go on with (null: the connection ends); buffer keeps what
    // was read and is still to be handled.
    std::shared_ptr<Channel> Greet(std::string &buffer);
    bool Handle(wire::Kind kind, wire::In &in);
    // The library's ids that share a feed: nearly always one, kept in place.
    class FeedMembers {
    public:
        uint32_t Size() const { return m_count; }
        uint32_t &operator[](uint32_t i) { return i == 0 ? m_first : (*m_more)[i - 1]; }
        // Throws std::bad_alloc when a second member finds no memory, the
        // members unchanged.
        void Add(uint32_t id);
        void RemoveLast();
        template <class Each> void ForEach(Each each) const
        {
            if (m_count)
                each(m_first);
            if (m_more)
                for (uint32_t id : *m_more)
                    each(id);
        }

    private:
        uint32_t m_first = 0;
        uint32_t m_count = 0;
        std::unique_ptr<std::vector<uint32_t>> m_more;
    };
    // A feed lives in a page of the session's table, not in a heap block of
    // its own (a block's header and the pointer to it cost a fifth of it).
    // What a value reads and writes first, in the feed's first cache line.
    struct Feed {
        enum Flag : uint8_t {
            kHasAttributes = 1,
            kDead = 2,     // its member has gone: a newcomer makes a new feed
            kHeld = 4,     // a value not sent yet: the library is behind
            kLongData = 8, // the last Data fields are in the session's table of long ones
        };
        uint32_t id = 0;         // with its slot's generation: the engine's cookie; 0 while free
        uint16_t generation = 0; // of the slot: kept while it is free
        uint8_t statusCount = 0; // statuses since the last "connecting"
        uint8_t flags = 0;
        uint8_t statuses[6];
        // The attributes: the mask's and the access's low bytes (the network
        // sets no other bits) and the data type.
        uint8_t attributeMask = 0;
        uint8_t access = 0;
        uint16_t dataType = 0;
        // The last Data fields, in place when a number's or a boolean's (a
        // text's are kept in the session's table of long ones, by the
        // feed's slot: they are rare, and each feed would otherwise carry a
        // pointer); 0 bytes when there are none or they are long.
        uint8_t dataSize = 0;
        char data[wire::PackedFields::kMostBytes];
        // The URL's two hashes, 96 bits: URLs that agree on both are taken
        // as one (the URL itself is not kept: it would double the feed).
        uint32_t check = 0;
        uint64_t hash = 0;
        CadroDataItem *item = nullptr;
        FeedMembers members;

        bool Has(Flag flag) const { return (flags & flag) != 0; }
        void Set(Flag flag, bool on) { flags = on ? (flags | flag) : (flags & ~flag); }
        bool HasData() const { return dataSize != 0 || Has(kLongData); }
    };
    static constexpr uint32_t kPageBits = 10;
    static constexpr uint32_t kPageSize = 1u << kPageBits;

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
    Feed *FeedOf(uint32_t feedId);
    Feed &FeedAt(uint32_t slot) { return m_pages[slot >> kPageBits][slot & (kPageSize - 1)]; }
    void StoreData(Feed &feed, std::string_view fields);
    std::string_view DataOf(const Feed &feed) const;
    void ClearData(Feed &feed);
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
    std::vector<std::unique_ptr<Feed[]>> m_pages; // the feeds, by slot
    uint32_t m_slots = 0;                         // slots made so far
    std::vector<uint32_t> m_freeFeeds;
    std::unordered_map<uint32_t, std::string> m_longData; // by slot: LastData::isLong
    std::vector<uint32_t> m_held;                         // feeds with a value held back
    std::atomic<bool> m_holding{false};
    // Shared feeds (slot + 1) by the URL's hash, which the index reads from
    // the feed; a URL whose hash another one has takes a feed that is not
    // found here (it is not shared).
    struct UrlHashOf {
        NodeSession *session;
        uint64_t operator()(uint32_t handle) const { return session->FeedAt(handle - 1).hash; }
    };
    FlatIndex<UrlHashOf> m_feedOfUrl{UrlHashOf{this}};
    Memberships m_memberships;
    FrameQueue m_queue;
    bool m_replied = false; // the reading thread's: a reply waits to be written
    std::thread m_reader;
};

} // namespace cadrosim

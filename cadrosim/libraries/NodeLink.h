#pragma once
// The libraries' side of the network node, one per server process and shared
// by its sessions: one connection to the node (started when none runs), its
// pipe and the shared rings set up over it, the subscriptions made through
// it and the requests in flight. When the connection breaks, every
// subscription is told that the node disconnected it; the link connects
// again (starting a node unless the last one was shut down on purpose) and
// subscribes again to all of them.
//
// A node reaches the machines that another machine's node serves the same
// way, through a link to that node's TCP address (never started from here).
#include "Backend.h"
#include "FrameQueue.h"
#include "KnownMembers.h"
#include "LinkFeed.h"
#include "MemberMirror.h"
#include "Network.h"
#include "SlotTable.h"
#include "Unknown.h"

#include <memory>
#include <thread>
#include <unordered_map>
#include <vector>

namespace cadrosim {

class NodeLink;
class RemoteSubscription;

// A subscription through the node; the CadroDataItem its holder keeps. It
// lives in its link's table (SlotTable.h), which the link's Subscribe makes
// it in.
class RemoteSubscription : public CSimUnknown<CadroDataItem> {
public:
    // In storage from the link's table, its receiver in the link's place
    // receiverPlace: the receiver already has a reference for it, and the
    // link a use.
    RemoteSubscription(uint8_t link, uint8_t receiverPlace, void *c)
        : cookie(c), m_receiverPlace(receiverPlace), m_link(link)
    {
    }
    ~RemoteSubscription() override = default;
    // Ends it: its place goes back to the link, its receiver's reference
    // and the link's use with it.
    void Delete();

    HRESULT STDMETHODCALLTYPE Write(const CadroValue *value) override;
    HRESULT STDMETHODCALLTYPE Read(uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time) override;
    void LastRelease() override;

    // Under the link's lock: the URL (its feed's).
    std::wstring Url() const { return feed->Url(); }

    // Under the link's lock: the member as the node last sent it (its
    // feed's).
    HRESULT Recall(uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time) const;
    bool Connected() const { return feed->mirror.Connected(); }

    // First, where the reference count leaves room in the object's first
    // eight bytes.
    uint32_t id = 0;
    void *cookie;
    // Under the link's lock: its feed, and the ids of the members before
    // and after it there (0: none). A subscription in the table always has
    // a feed (it gets its own with its id, and leaves the last one as it is
    // forgotten).
    LinkFeed *feed = nullptr;
    uint32_t prev = 0;
    uint32_t next = 0;

    // The link's handles on the object: one for its place in the table
    // (until its holder lets go), one for each status or attributes call
    // on its way to it, and one while a batch of values that lists it is
    // being delivered after its holder let go. The last to go deletes it.
    void Pin() { m_pins.fetch_add(1, std::memory_order_relaxed); }
    void Unpin()
    {
        if (m_pins.fetch_sub(1) == 1)
            Delete();
    }
    // Calls the receiver through call, unless the holder has let go. A
    // holder that lets go meanwhile waits for the call to return (Forgotten).
    template <class Call> void Deliver(Call call, std::atomic<int> &waiters, SlimMutex &lock, SlimCondition &returned)
    {
        m_calling.fetch_add(1);
        {
            Calling here(this);
            if (!IsForgotten())
                call(*this);
        }
        m_calling.fetch_sub(1);
        if (waiters.load() != 0) {
            // Under the lock, so that a holder between its check and its
            // sleep cannot miss the wake.
            lock.lock();
            lock.unlock();
            returned.notify_all();
        }
    }
    // Under the lock: no calls from now on. Returned() tells when the calls
    // under way on other threads are over (this thread's own, further up
    // its stack, do not count).
    void Forgotten() { m_calling.fetch_or(kForgotten); }
    bool IsForgotten() const { return (m_calling.load() & kForgotten) != 0; }
    bool Returned() const { return (m_calling.load() & ~kForgotten) == Calling::OnThisThread(this); }

    // Whom it calls: the link keeps each receiver once (NodeLink::ReceiverAt).
    uint8_t ReceiverPlace() const { return m_receiverPlace; }
    ICadroRealTimeReceiver *Receiver() const;

private:
    // The calls under way on a thread, innermost first, each on its
    // caller's stack: a thread may call a holder that lets go of another
    // subscription, or of the one it is being called for.
    class Calling {
    public:
        explicit Calling(const RemoteSubscription *sub) : m_sub(sub), m_outer(t_innermost) { t_innermost = this; }
        ~Calling() { t_innermost = m_outer; }
        Calling(const Calling &) = delete;
        Calling &operator=(const Calling &) = delete;
        static unsigned OnThisThread(const RemoteSubscription *sub);

    private:
        static thread_local Calling *t_innermost;
        const RemoteSubscription *m_sub;
        Calling *m_outer;
    };

    NodeLink &Link() const;
    // The calls under way, and kForgotten once the holder has let go: one
    // word, so that a call either sees the holder gone or is counted before
    // the holder looks.
    static constexpr uint16_t kForgotten = 0x8000;
    std::atomic<uint16_t> m_calling{0};
    uint8_t m_receiverPlace;
    uint8_t m_link; // NodeLink::At
    std::atomic<uint32_t> m_pins{1};
};
// A place in the table a subscription: the holder's cookie, its feed and
// neighbours there, its receiver's place, and small counts.
static_assert(sizeof(void *) != 8 || sizeof(RemoteSubscription) == 48, "a subscription is 48 bytes");

class NodeLink final : public Backend {
public:
    // The link to this machine's node.
    static NodeLink &Instance();
    // The link to the node at a TCP address ("host:port"), made on first
    // use and kept for the process's life; null when too many are made.
    static NodeLink *ForAddress(const std::wstring &address);
    static NodeLink &At(uint8_t index);
    // The receiver of a subscription's place (RemoteSubscription::Receiver).
    ICadroRealTimeReceiver *ReceiverAt(uint8_t place) const { return m_receivers[place].receiver; }
    uint8_t Index() const { return m_index; }
    const std::wstring &Address() const { return m_address; }

    // Library objects and subscriptions keep the link (and its threads) up.
    void AddUse() override;
    void ReleaseUse() override;

    HRESULT Subscribe(const wchar_t *url, void *cookie, ICadroRealTimeReceiver *receiver, CadroDataItem **out) override;
    void Unsubscribe(RemoteSubscription *sub);
    // Without the lock: sub, unpinned by all, goes (RemoteSubscription::Delete).
    void Destroy(RemoteSubscription *sub);
    HRESULT Write(RemoteSubscription *sub, const CadroValue *value);
    HRESULT Read(RemoteSubscription *sub, uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time);
    bool Browse(const std::wstring &url, std::vector<BrowseEntry> &out) override;
    // A use of their own keeps the link up for the request.
    std::wstring Execute(const std::wstring &command) override;
    bool Load(const std::wstring &description, std::wstring &error) override;

    void AddBrowserReceiver(ICadroBrowserReceiver *receiver) override;
    void RemoveBrowserReceiver(ICadroBrowserReceiver *receiver) override;
    // Whether a listing through this link confirmed the member's URL.
    bool Knows(const std::wstring &url);

private:
    enum class State { Stopped, Connecting, Connected, Down };
    // A request waiting for its answer. Its asker alone is woken: a read
    // ahead has several requests in flight, and a wake of every asker for
    // each answer costs a round through the system for each.
    struct Pending {
        bool done = false;
        bool answered = false;
        std::string reply;
        SlimCondition wake;
        // Under m_lock: the asker may leave (and the Pending go) as soon as
        // the lock is let go, so the wake is given under it.
        void Finish()
        {
            done = true;
            wake.notify_all();
        }
    };

    NodeLink(uint8_t index, std::wstring address) : m_index(index), m_address(std::move(address)) {}
    void Start();
    void Stop(std::unique_lock<SlimMutex> &l);
    void Run(unsigned generation);
    std::shared_ptr<Channel> Connect(bool mayStart, unsigned generation);
    void Serve(Channel &channel);
    void Dispatch(wire::Kind kind, wire::In &in);
    // Values arrive in batches: each id's subscription (or feed's members)
    // is looked up and the value remembered under one hold of the lock per
    // batch, then the receivers are called without it.
    void TakeData(wire::In &in, bool feeds);
    void DeliverData();
    // Under m_lock: remembers the values of the batch's entries from from
    // on and lists the calls they make, until the round holds
    // kCallsPerRound (a feed's members all go in one); returns the entry
    // after the last taken.
    size_t GatherCalls(size_t from);
    // Without the lock: the calls listed.
    void MakeGatheredCalls();
    // Asks for the feed of the batch's entry i, and for the place in the
    // table of one further on.
    void PrefetchFeed(size_t i) const;
    // The link's thread publishes the subscription it calls now (null when
    // none) and wakes holders waiting for a call to end.
    void WakeWaiters(RemoteSubscription *calling);
    // Under m_lock: a subscription joins the node's feed; a member enters a
    // feed or leaves it (the last to leave deletes it).
    void Join(uint32_t id, uint32_t feedId);
    void AddMember(LinkFeed &feed, RemoteSubscription *sub);
    void RemoveMember(RemoteSubscription *sub);
    // f(RemoteSubscription *) for each member of the feed; f changes no
    // feed's members.
    template <class F> void ForEachMember(const LinkFeed &feed, F f) const;
    LinkFeed *FeedOf(uint32_t feedId) const;
    // The node has dropped the feed: its members go on with what it last
    // had, each in a feed of its own.
    void Unshare(LinkFeed &feed);
    void DropFeeds();
    void Disconnected();
    // Out of the table, then waits for a call to it under way on another
    // thread; the caller then unpins it.
    void Forget(RemoteSubscription *sub, std::unique_lock<SlimMutex> &l);
    // Calls the subscription's receiver, unless it has gone; first, under
    // the lock, note(sub) when given.
    template <class Call, class Note> void CallSubscription(uint32_t id, Call call, Note note);
    template <class Call> void CallSubscription(uint32_t id, Call call)
    {
        CallSubscription(id, call, [](RemoteSubscription &) {});
    }
    // The same for every member of a feed; note(feed) first.
    template <class Call, class Note> void CallFeed(uint32_t feedId, Call call, Note note);
    // Calls a subscription pinned under the lock, then unpins it.
    template <class Call> void CallPinned(RemoteSubscription *sub, Call call);
    void TopologyChanged();
    // Whether the node's catalogue names url's member: then its subscription
    // cannot fail, and need not wait for the node's answer. The catalogue is
    // fetched by the first subscriber that needs it after a topology change
    // or a new connection, in one request that the others wait for. False
    // when it could not be had (the node's answer then decides).
    bool Catalogued(const wchar_t *url);
    // Whether the node is connected, waiting for one being connected to (a
    // node being started) unless it is another machine's and no answer is
    // needed (forAnswer).
    bool WaitConnected(std::unique_lock<SlimMutex> &l, bool forAnswer);
    bool OnLinkThread() const { return GetCurrentThreadId() == m_linkThreadId; }

    // Under m_lock: a new subscription in the table (null when it is full
    // or memory is short), the table's of id, one out of the table.
    RemoteSubscription *NewSubscription(ICadroRealTimeReceiver *receiver, void *cookie);
    // Under m_lock: the place of receiver for one more subscription (false
    // when every place holds another receiver); one subscription fewer, and
    // the receiver of the place.
    bool TakeReceiverPlace(ICadroRealTimeReceiver *receiver, uint8_t &place);
    ICadroRealTimeReceiver *GiveReceiverPlace(uint8_t place);
    RemoteSubscription *Lookup(uint32_t id) const { return m_subs.Find(id); }
    void Unregister(RemoteSubscription *sub) { m_subs.Leave(sub->id); }
    template <class Fill> bool Send(wire::Kind kind, Fill fill);
    // Sends a request and waits for its reply (its fields after the request
    // number); false when the node did not answer.
    template <class Fill> bool Ask(wire::Kind kind, Fill fill, std::string &reply);

    const uint8_t m_index;
    const std::wstring m_address; // empty: this machine's node, by its pipe
    SlimMutex m_lock;
    SlimCondition m_changed;      // the state, and the catalogue
    SlimCondition m_callReturned; // a call to a forgotten subscription returned
    std::atomic<int> m_callWaiters{0};
    std::atomic<RemoteSubscription *> m_callingSub{nullptr}; // by DeliverData
    bool m_delivering = false;                               // a batch of values is being delivered
    std::vector<RemoteSubscription *> m_graveyard;           // let go during it
    State m_state = State::Stopped;
    long m_uses = 0;
    unsigned m_generation = 0; // of the threads that should run; Stop() moves it on
    bool m_mayStartNode = true;
    DWORD m_lastFailure = 0; // when an attempt to connect last failed
    std::shared_ptr<Channel> m_channel;
    FrameQueue m_queue;
    SlotTable<RemoteSubscription, wire::kSubscriptionSlotBits> m_subs;
    std::vector<LinkFeed *> m_feeds; // by the node's slot of the feed
    // The receivers of the subscriptions, each once, with the number of
    // subscriptions that call it: a subscription keeps its receiver's place
    // (a byte) rather than its address (eight), and a server has one
    // receiver for all its items. The places do not move, and one is not
    // reused while a subscription of it lives, so a subscription's receiver
    // is read without the lock; they change under it.
    struct ReceiverPlace {
        ICadroRealTimeReceiver *receiver = nullptr;
        uint32_t subscriptions = 0;
    };
    static constexpr size_t kMostReceivers = 256;
    ReceiverPlace m_receivers[kMostReceivers];
    uint32_t m_nextRequest = 0;
    std::unordered_map<uint32_t, Pending *> m_pending;
    KnownMembers m_known; // under m_lock
    // The lists of the batch of values being delivered, the link thread's
    // alone, kept from one batch to the next (no allocation per batch).
    struct Batch {
        struct Fields {
            uint32_t flags;
            CadroValue value;
            int32_t error;
            uint32_t low, high;
        };
        std::vector<Fields> fields;
        // id (or feed, with kFeedBit on the index), index of its fields
        std::vector<std::pair<uint32_t, uint32_t>> ids;
        std::vector<std::pair<RemoteSubscription *, uint32_t>> subs;
        std::vector<RemoteSubscription *> feedCall; // CallFeed's
    };
    Batch m_batch;
    std::vector<ICadroBrowserReceiver *> m_browserReceivers;
    HANDLE m_wake = nullptr; // cuts the pause between reconnections short
    DWORD m_linkThreadId = 0;
    std::thread m_thread;
};

inline ICadroRealTimeReceiver *RemoteSubscription::Receiver() const
{
    return Link().ReceiverAt(m_receiverPlace);
}

template <class F> void NodeLink::ForEachMember(const LinkFeed &feed, F f) const
{
    // Every member is in the table: a subscription leaves its feed before
    // it leaves the table.
    for (uint32_t id = feed.head; id != 0;) {
        RemoteSubscription *sub = Lookup(id);
        if (!sub)
            return;
        id = sub->next;
        f(sub);
    }
}

} // namespace cadrosim

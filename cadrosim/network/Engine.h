#pragma once
// The one simulation engine of a process: the network, its delivery threads,
// the subscriptions and the control commands. Every library object of CDREALT
// and CDBROW is backed by it.
#include "Backend.h"
#include "Network.h"
#include "SlimSync.h"
#include "Unknown.h"

#include <atomic>
#include <chrono>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <new>
#include <queue>
#include <random>
#include <thread>
#include <unordered_map>
#include <vector>

namespace cadrosim {

class Engine;

// This machine's name, read once.
const std::wstring &LocalHostName();
// A text file in UTF-8; false when it cannot be read.
bool ReadTextFile(const std::wstring &path, std::wstring &text);

// One value of a tick for one subscription, as OnData takes it.
struct DataEntry {
    void *cookie;
    const CadroValue *value;
    int32_t error;
    uint32_t low, high;
};

// A receiver inside this library that takes a tick's values in one call
// (a node's session): it then holds its locks once for the batch rather
// than once for each value. Its subscriptions' other callbacks still come
// through ICadroRealTimeReceiver. Every entry has the flags value, quality
// and time.
class BatchReceiver {
public:
    virtual void OnDataBatch(const DataEntry *entries, size_t count) = 0;
    // The receiver whose batches these are.
    virtual ICadroRealTimeReceiver *Receiver() = 0;

protected:
    ~BatchReceiver() = default;
};

// One subscription; it is the CadroDataItem the subscriber holds. A node
// holds one for each member that a library subscribed to: it is kept to
// 48 bytes, in a pool of its kind rather than a heap block of its own.
struct Subscription : CSimUnknown<CadroDataItem> {
    // batch: the receiver's batch interface, when it has one.
    Subscription(MemberPtr member, ICadroRealTimeReceiver *receiver, BatchReceiver *batch, void *cookie);
    ~Subscription() override;
    static void *operator new(size_t size, const std::nothrow_t &) noexcept;
    static void operator delete(void *place) noexcept;
    static void operator delete(void *place, const std::nothrow_t &) noexcept; // a constructor that threw

    HRESULT STDMETHODCALLTYPE Write(const CadroValue *value) override;
    HRESULT STDMETHODCALLTYPE Read(uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time) override;
    void LastRelease() override;

    // Set when its holder lets go: nothing calls it any more, and it is
    // deleted once nothing refers to it.
    std::atomic<bool> dead{false};
    // Guarded by the member's shard:
    bool active = false; // receives values
    uint32_t queued = 0; // events of it in the shard's queue
    uint32_t slot = 0;   // its place in the member's subscriptions
    MemberPtr member;
    void *cookie;

    // Whom it calls (null once it has let go of its receiver), and the
    // receiver's batch interface when it takes batches.
    ICadroRealTimeReceiver *Receiver() const
    {
        BatchReceiver *batch = Batch();
        return batch ? batch->Receiver() : reinterpret_cast<ICadroRealTimeReceiver *>(m_target);
    }
    BatchReceiver *Batch() const
    {
        return (m_target & kBatched) ? reinterpret_cast<BatchReceiver *>(m_target & ~kBatched) : nullptr;
    }
    // Lets go of the receiver: the caller releases it.
    ICadroRealTimeReceiver *TakeReceiver();

private:
    // The receiver, or its batch interface (which names it) with kBatched
    // set: one pointer either way.
    static constexpr uintptr_t kBatched = 1;
    uintptr_t m_target;
};

// Open: the whole answer to a subscription on a connected machine (contacted,
// subscribed, attributes, then values), delivered as one batch.
enum class EventKind { Status, Attributes, Activate, Value, Open };

struct Event {
    Subscription *sub;
    EventKind kind;
    uint32_t status;
};

// A delivery thread with the members assigned to it: their periodic updates
// (a heap of due times) and the events of their subscriptions, in order.
class Shard {
public:
    explicit Shard(Engine &engine) : m_engine(engine) {}
    void Start();
    // Safe from the shard's own thread (it is then left to finish alone).
    void Stop();

    SlimMutex lock;
    // Under lock: queue an event / put a member on the heap.
    void Post(Subscription *sub, EventKind kind, uint32_t status = 0);
    void Schedule(const MemberPtr &member);
    // Under lock: a new subscription joins its member's list.
    static void Attach(Subscription *sub);
    // Under lock (held by l): ends the subscription's deliveries and says
    // who deletes it.
    enum class Disposal {
        Now,        // the caller, at once
        AfterQueue, // the shard, when its queued events come up
        AfterUnit   // the shard, after the event or tick whose callback released it
    };
    Disposal Release(Subscription *sub, std::unique_lock<SlimMutex> &l);
    bool OnShardThread() const { return GetCurrentThreadId() == m_threadId; }

private:
    using Clock = std::chrono::steady_clock;
    // The members of one period, ticked together at its slots (see
    // NextSlot): a tick walks one array of members rather than popping each
    // off a heap.
    struct Cadence {
        unsigned period = 0;
        Clock::time_point next; // its next slot, while on the heap
        size_t cursor = 0;      // members of the slot under way already ticked
        bool onHeap = false;
        std::vector<MemberPtr> members; // each knows its place
    };
    // A cadence's next slot.
    struct Due {
        Clock::time_point at;
        uint32_t cadence;
        bool operator>(const Due &o) const { return at > o.at; }
    };

    void Run(unsigned generation);
    // Between units: deletes, with the lock released, the subscriptions
    // released from inside callbacks that nothing refers to any more.
    void Sweep(std::unique_lock<SlimMutex> &l);
    // The clocks of the moment a batch of ticks began, read once for all
    // of them: under Wine each reading is a call into the system's side.
    struct Moment {
        Clock::time_point now;
        double elapsedMs;
        FILETIME time;
    };
    // The members due at the moment, up to a limit: their values computed
    // under the lock, then delivered together without it.
    void TickDue(std::unique_lock<SlimMutex> &l, const Moment &moment, unsigned generation);
    // Ticks the cadence's members from its cursor, at most budget of them;
    // false when the slot is not done yet.
    bool TickCadence(uint32_t index, const Moment &moment, int &budget);
    // Under the lock: the member's next value; its active subscriptions
    // join the tick's targets. False when it is to leave its cadence (no
    // subscriber, or removed from the network).
    bool Tick(Member &m, const Moment &moment);
    // A member enters its period's cadence (which goes on the heap if it
    // was off), or leaves it.
    void Join(MemberPtr member, Clock::time_point now);
    void Leave(Cadence &cadence, size_t place);
    // Whether anything is to be ticked at the moment.
    bool HasDue(const Moment &moment) const;
    // The first slot of a period after a time. Periods count from the
    // engine's start, so that members of one period tick together: one wake
    // of the shard and one batch for all of them every period, rather than
    // one for each, microseconds apart.
    Clock::time_point NextSlot(Clock::time_point after, unsigned period) const;
    // Without the lock: the tick's values to their receivers, a run of
    // subscriptions of one batch receiver in one call.
    void DeliverTick();
    void Dispatch(std::unique_lock<SlimMutex> &l, Event e);
    // Runs callbacks with the lock released (always inside a unit).
    template <class F> void Deliver(std::unique_lock<SlimMutex> &l, F callbacks);
    // One event or tick of the shard's thread, which may deliver several
    // batches and read its subscriptions between them; wakes waiting
    // releases when it ends.
    template <class F> void Unit(F work);
    bool InUnit() const { return m_unitsFinished != m_unitsStarted; }

    Engine &m_engine;
    SlimCondition m_wake;
    SlimCondition m_unitDone;
    std::deque<Event> m_events;
    std::vector<Cadence> m_cadences;
    std::unordered_map<unsigned, uint32_t> m_cadenceOf; // by period
    std::priority_queue<Due, std::vector<Due>, std::greater<Due>> m_heap;
    // Members without a value yet: ticked at once, then in their cadence.
    std::vector<MemberPtr> m_firsts;
    std::vector<MemberPtr> m_ticking; // the firsts being ticked
    std::vector<Subscription *> m_graveyard;
    // Of the tick under way: the values computed (indexes into m_values)
    // and who receives them; the shard's, kept between ticks.
    struct Computed {
        CadroValue value;
        int32_t error;
        uint32_t low, high;
    };
    std::vector<Computed> m_values;
    std::vector<std::pair<Subscription *, uint32_t>> m_targets;
    std::vector<DataEntry> m_entries;
    // Units of work of the shard's thread begun and ended: a release from
    // another thread waits only for the unit in flight when it detached
    // (which may still read the subscription after a batch of callbacks),
    // never for an idle moment.
    uint64_t m_unitsStarted = 0;
    uint64_t m_unitsFinished = 0;
    unsigned m_generation = 0;
    DWORD m_threadId = 0;
    bool m_busy = false;   // events came since the thread last slept
    bool m_dozing = false; // a post does not wake it: it looks again soon
    std::thread m_thread;
};

class Engine final : public Backend {
public:
    static Engine &Instance();

    // Library objects (sessions) and subscriptions keep the threads and the
    // control channel running.
    void AddUse() override;
    void ReleaseUse() override;

    HRESULT Subscribe(const wchar_t *url, void *cookie, ICadroRealTimeReceiver *receiver, CadroDataItem **out) override
    {
        return Subscribe(url, cookie, receiver, out, false, nullptr);
    }
    // hereOnly: a machine that another node serves is unknown (a node
    // passes on only its libraries' requests, so that two nodes that name
    // each other cannot send one round for ever).
    // batch: the receiver's batch interface, when it has one.
    HRESULT Subscribe(const wchar_t *url, void *cookie, ICadroRealTimeReceiver *receiver, CadroDataItem **out,
                      bool hereOnly, BatchReceiver *batch);
    void Unsubscribe(Subscription *sub);
    HRESULT Write(Subscription *sub, const CadroValue *value);
    HRESULT Read(Subscription *sub, uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time);
    bool List(const std::wstring &url, std::vector<BrowseEntry> &out);
    // A browse session's listing: counted, for "status".
    bool Browse(const std::wstring &url, std::vector<BrowseEntry> &out, bool hereOnly);
    bool Browse(const std::wstring &url, std::vector<BrowseEntry> &out) override { return Browse(url, out, false); }

    // Whether a subscription to url will find its member: known here, or
    // confirmed by a listing of the node that serves its machine.
    bool HasMember(const std::wstring &url);
    // Network::Catalogue of this engine's network.
    void Catalogue(std::vector<uint64_t> &out);
    // Who ends the process when "shutdown" is asked (only a network node).
    void SetShutdownHandler(std::function<void()> handler);

    void AddBrowserReceiver(ICadroBrowserReceiver *receiver) override;
    void RemoveBrowserReceiver(ICadroBrowserReceiver *receiver) override;
    // Tells the browser receivers that the topology changed.
    void NotifyTopologyChanged();

    // Runs one control command; the answer's first line is "ok" or "error: ...".
    std::wstring Execute(const std::wstring &command) override;
    // Replaces the network with a description (subscriptions keep their old
    // members). False with a line-numbered error.
    bool Load(const std::wstring &description, std::wstring &error) override;

    double ElapsedMs() const { return ElapsedMs(std::chrono::steady_clock::now()); }
    double ElapsedMs(std::chrono::steady_clock::time_point now) const;
    std::chrono::steady_clock::time_point Epoch() const { return m_epoch; }
    unsigned NextShard() { return m_nextShard++ % m_shards.size(); }
    std::mt19937 &Random() { return m_random; }

private:
    Engine();
    void LoadInitialNetwork();
    void StartThreads();
    void StopThreads();
    void AssignShards();
    MemberPtr FindMember(const std::wstring &url, Machine **machine = nullptr);
    // The link to the node that serves the machine of url, when another
    // node serves it; else null.
    class NodeLink *RemoteNodeOf(const std::wstring &url);
    // The children of url, from the node of link when it is not null.
    bool ListOn(class NodeLink *link, const std::wstring &url, std::vector<BrowseEntry> &out);
    // Under m_useLock: the links of the network's machines on other nodes
    // are used while the engine is.
    void UseRemoteNodes(const std::vector<class NodeLink *> &links, bool use);

    // Control commands. A command on a machine that another node serves is
    // refused with that node's address.
    std::wstring ServedElsewhere(const std::wstring &verb, const std::vector<std::wstring> &args);
    std::wstring Publish(const std::vector<std::wstring> &args);
    std::wstring AddMemberCommand(const std::vector<std::wstring> &args);
    std::wstring RemoveMemberCommand(const std::vector<std::wstring> &args);
    std::wstring SetConnected(const std::vector<std::wstring> &args, bool connected);
    std::wstring SetStalled(const std::vector<std::wstring> &args, bool stalled);
    std::wstring ListSubscriptions();
    std::wstring Show(const std::vector<std::wstring> &args);
    std::wstring BrowseCommand(const std::vector<std::wstring> &args);
    std::wstring Status();

    friend class Shard;
    friend class ControlPipe;
    SlimMutex m_networkLock; // the topology; outside any shard lock
    std::unique_ptr<Network> m_network;
    std::vector<std::unique_ptr<Network>> m_retired;
    std::wstring m_networkSource;
    std::wstring m_loadError;
    std::vector<std::unique_ptr<Shard>> m_shards;
    std::atomic<unsigned> m_nextShard{0};
    SlimMutex m_useLock;
    long m_uses = 0;
    std::unique_ptr<class ControlPipe> m_pipe;
    std::vector<class NodeLink *> m_remoteNodes; // of the network, under m_useLock
    std::atomic<bool> m_hasRemoteNodes{false};
    ICadroBrowserReceiver *m_topologyRelay; // their topology changes, told here
    SlimMutex m_receiversLock;
    std::vector<ICadroBrowserReceiver *> m_browserReceivers;
    std::chrono::steady_clock::time_point m_epoch;
    std::mt19937 m_random;
    std::atomic<long> m_subscriptionCount{0};
    std::atomic<unsigned long> m_browseCount{0};
    std::atomic<unsigned long> m_readCount{0}; // reads this engine answered (status)
    SlimMutex m_shutdownLock;
    std::function<void()> m_shutdown;
};

// Runs commands from other programs: one named pipe per engine,
// "\\.\pipe\CadroSim-<process id>".
class ControlPipe {
public:
    explicit ControlPipe(Engine &engine);
    ~ControlPipe();

private:
    void Run();

    Engine &m_engine;
    HANDLE m_stop;
    std::thread m_thread;
};

} // namespace cadrosim

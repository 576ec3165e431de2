#include "Engine.h"

#include "Prefetch.h"
#include "Source.h"
#include "ThreadName.h"

#include <algorithm>

namespace cadrosim {

namespace {
void Attributes(const Member &m, CadroAttributes &a)
{
    a = {};
    a.mask = 0x02 | 0x04;
    a.dataType = static_cast<uint16_t>(m.type);
    a.access = m.access;
}

constexpr auto kTickSlack = std::chrono::milliseconds(1);
// Events (subscriptions, writes) are not kept waiting behind a long batch.
constexpr int kMostTicksInARow = 4096;
constexpr auto kDoze = std::chrono::microseconds(500);

void Split(const FILETIME &ft, uint32_t &low, uint32_t &high)
{
    low = ft.dwLowDateTime;
    high = ft.dwHighDateTime;
}
} // namespace

void Shard::Start()
{
    std::lock_guard<SlimMutex> l(lock);
    unsigned generation = ++m_generation;
    m_thread = NamedThread(L"shard", [this, generation] { Run(generation); });
}

void Shard::Stop()
{
    std::thread thread;
    {
        std::lock_guard<SlimMutex> l(lock);
        ++m_generation;
        thread = std::move(m_thread);
    }
    m_wake.notify_all();
    if (!thread.joinable())
        return;
    if (thread.get_id() == std::this_thread::get_id())
        thread.detach(); // stopped from its own callbacks: it ends after them
    else
        thread.join();
}

void Shard::Post(Subscription *sub, EventKind kind, uint32_t status)
{
    ++sub->queued;
    // The thread sleeps only on an empty queue: waking it for every event
    // would cost a system call each.
    bool wake = m_events.empty() && !m_dozing;
    m_events.push_back({sub, kind, status});
    if (wake)
        m_wake.notify_one();
}

void Shard::Attach(Subscription *sub)
{
    auto &subs = sub->member->subscriptions;
    sub->slot = subs.size();
    subs.push_back(sub);
}

void Shard::Schedule(const MemberPtr &member)
{
    if (member->scheduled || member->source.kind == SourceKind::Const || member->source.period == 0)
        return;
    member->scheduled = true;
    // Nothing computed the member while nobody received it: a value it holds
    // is as old as its last subscriber, and the new one gets a value of now.
    // A counter or toggle takes one step, as at any tick. A member without a
    // value yet produces its first at the next tick, at once.
    Clock::time_point now = Clock::now();
    Member &m = *member;
    if (m.hasValue && !m.stalled && m.machine && m.machine->connected) {
        m.value = NextValue(m, m_engine.ElapsedMs(now), m_engine.Random());
        GetSystemTimeAsFileTime(&m.time);
    }
    if (m.hasValue)
        Join(member, now);
    else
        m_firsts.push_back(member);
    m_wake.notify_one();
}

void Shard::Join(MemberPtr member, Clock::time_point now)
{
    const unsigned period = member->source.period;
    auto found = m_cadenceOf.find(period);
    uint32_t index;
    if (found != m_cadenceOf.end()) {
        index = found->second;
    } else {
        index = static_cast<uint32_t>(m_cadences.size());
        m_cadences.emplace_back();
        m_cadences.back().period = period;
        m_cadenceOf.emplace(period, index);
    }
    Cadence &cadence = m_cadences[index];
    member->cadenceSlot = static_cast<uint32_t>(cadence.members.size());
    cadence.members.push_back(std::move(member));
    if (!cadence.onHeap) {
        cadence.onHeap = true;
        cadence.next = NextSlot(now, period);
        m_heap.push({cadence.next, index});
    }
}

void Shard::Leave(Cadence &cadence, size_t place)
{
    cadence.members[place]->scheduled = false;
    if (place + 1 != cadence.members.size()) {
        cadence.members[place] = std::move(cadence.members.back());
        cadence.members[place]->cadenceSlot = static_cast<uint32_t>(place);
    }
    cadence.members.pop_back();
}

Shard::Disposal Shard::Release(Subscription *sub, std::unique_lock<SlimMutex> &l)
{
    // Out of the member's list in one step: the last one takes its place.
    sub->dead = true;
    auto &subs = sub->member->subscriptions;
    subs[sub->slot] = subs.back();
    subs[sub->slot]->slot = sub->slot;
    subs.pop_back();
    if (!InUnit())
        return sub->queued == 0 ? Disposal::Now : Disposal::AfterQueue;
    if (OnShardThread()) {
        m_graveyard.push_back(sub); // released from inside a callback of this unit
        return Disposal::AfterUnit;
    }
    // Held like a queued event while the lock is let go for the wait, so
    // that the shard does not delete it when its last event comes up.
    ++sub->queued;
    uint64_t unit = m_unitsStarted;
    m_unitDone.wait(l, [this, unit] { return m_unitsFinished >= unit; });
    --sub->queued;
    // Queued events are skipped when they come up; the last one deletes it.
    return sub->queued == 0 ? Disposal::Now : Disposal::AfterQueue;
}

void Shard::Sweep(std::unique_lock<SlimMutex> &l)
{
    // Those with events still queued go when the last one comes up.
    if (m_graveyard.empty())
        return;
    std::vector<Subscription *> dead;
    for (Subscription *sub : m_graveyard)
        if (sub->queued == 0)
            dead.push_back(sub);
    m_graveyard.clear();
    if (dead.empty())
        return;
    l.unlock();
    for (Subscription *sub : dead)
        delete sub;
    l.lock();
}

template <class F> void Shard::Deliver(std::unique_lock<SlimMutex> &l, F callbacks)
{
    l.unlock();
    callbacks();
    l.lock();
}

template <class F> void Shard::Unit(F work)
{
    uint64_t unit = ++m_unitsStarted;
    work();
    m_unitsFinished = unit;
    m_unitDone.notify_all();
}

void Shard::Run(unsigned generation)
{
    m_threadId = GetCurrentThreadId();
    std::unique_lock<SlimMutex> l(lock);
    while (m_generation == generation) {
        if (!m_events.empty()) {
            Event e = m_events.front();
            m_events.pop_front();
            Subscription *sub = e.sub;
            --sub->queued;
            m_busy = true;
            if (!sub->dead) {
                Unit([&] { Dispatch(l, e); });
                // Subscriptions released by their own callbacks go once the
                // event that called them is done with them.
                Sweep(l);
            } else if (sub->queued == 0) {
                // Its holder let go while this event waited: the last
                // reference to it was this event.
                l.unlock();
                delete sub;
                l.lock();
            }
            continue;
        }
        // Members due within the next millisecond tick now, together, on
        // one reading of the clocks: many members of short periods would
        // otherwise wake the thread for each tick, microseconds apart.
        Moment moment;
        moment.now = Clock::now();
        if (HasDue(moment)) {
            moment.elapsedMs = m_engine.ElapsedMs(moment.now);
            GetSystemTimeAsFileTime(&moment.time);
            Unit([&] { TickDue(l, moment, generation); });
            Sweep(l);
            continue;
        }
        if (m_busy) {
            // After events the thread dozes a moment before it sleeps:
            // events posted meanwhile (a client subscribing to thousands of
            // members) wait for the doze's end together instead of waking
            // it one by one, each wake a system call on both sides.
            m_busy = false;
            m_dozing = true;
            auto until = moment.now + kDoze;
            m_wake.wait_until(l, m_heap.empty() || until < m_heap.top().at ? until : m_heap.top().at);
            m_dozing = false;
            continue;
        }
        if (m_heap.empty())
            m_wake.wait(l);
        else
            m_wake.wait_until(l, m_heap.top().at);
    }
}

bool Shard::HasDue(const Moment &moment) const
{
    return !m_firsts.empty() || (!m_heap.empty() && m_heap.top().at <= moment.now + kTickSlack);
}

void Shard::TickDue(std::unique_lock<SlimMutex> &l, const Moment &moment, unsigned generation)
{
    m_values.clear();
    m_targets.clear();
    // First values at once; their next ones come with their cadence.
    m_ticking.swap(m_firsts);
    for (MemberPtr &member : m_ticking) {
        if (Tick(*member, moment))
            Join(std::move(member), moment.now);
        else
            member->scheduled = false;
    }
    m_ticking.clear();
    int budget = kMostTicksInARow;
    while (budget > 0 && !m_heap.empty() && m_heap.top().at <= moment.now + kTickSlack && m_events.empty() &&
           m_generation == generation) {
        Due due = m_heap.top();
        if (!TickCadence(due.cadence, moment, budget))
            break; // the rest of the slot after the events, if any
        m_heap.pop();
        Cadence &cadence = m_cadences[due.cadence];
        cadence.cursor = 0;
        cadence.onHeap = !cadence.members.empty();
        if (cadence.onHeap) {
            // A shard that fell behind skips the slots it missed.
            cadence.next = NextSlot(std::max(due.at, moment.now), cadence.period);
            m_heap.push({cadence.next, due.cadence});
        }
    }
    if (!m_targets.empty())
        Deliver(l, [&] { DeliverTick(); });
    for (Computed &c : m_values)
        ClearCadroValue(c.value);
}

bool Shard::TickCadence(uint32_t index, const Moment &moment, int &budget)
{
    Cadence &cadence = m_cadences[index];
    auto &members = cadence.members;
    // The member is asked for before its first subscription.
    size_t i = cadence.cursor;
    while (i < members.size() && budget > 0) {
        if (i + 2 * kPrefetchAhead < members.size())
            PrefetchObject(members[i + 2 * kPrefetchAhead].get());
        if (i + kPrefetchAhead < members.size()) {
            SubscriberList &subs = members[i + kPrefetchAhead]->subscriptions;
            if (!subs.empty())
                __builtin_prefetch(subs[0]);
        }
        if (!Tick(*members[i], moment)) {
            Leave(cadence, i); // the last member takes its place, still to tick
            continue;
        }
        ++i;
        --budget;
    }
    cadence.cursor = i;
    return i >= members.size();
}

bool Shard::Tick(Member &m, const Moment &moment)
{
    if (m.removed || m.subscriptions.empty())
        return false;
    if (m.stalled || !m.machine->connected)
        return true;
    m.value = NextValue(m, moment.elapsedMs, m_engine.Random());
    m.hasValue = true;
    m.time = moment.time;

    auto index = static_cast<uint32_t>(m_values.size());
    Computed c = {};
    ToCadroValue(m.value, c.value);
    c.error = m.good ? 0 : 1;
    Split(m.time, c.low, c.high);
    m_values.push_back(c);
    for (Subscription *sub : m.subscriptions)
        if (sub->active)
            m_targets.push_back({sub, index});
    return true;
}

Shard::Clock::time_point Shard::NextSlot(Clock::time_point after, unsigned period) const
{
    const std::chrono::milliseconds slot(period);
    return m_engine.Epoch() + ((after - m_engine.Epoch()) / slot + 1) * slot;
}

void Shard::DeliverTick()
{
    constexpr uint32_t kFlags = kCadroHasValue | kCadroHasQuality | kCadroHasTime;
    BatchReceiver *batch = nullptr;
    auto flush = [&] {
        if (!m_entries.empty())
            batch->OnDataBatch(m_entries.data(), m_entries.size());
        m_entries.clear();
    };
    for (auto [sub, index] : m_targets) {
        // Released by a callback of this batch, or by another thread that
        // now waits for the batch to end.
        if (sub->dead)
            continue;
        const Computed &c = m_values[index];
        BatchReceiver *subBatch = sub->Batch();
        if (!subBatch) {
            sub->Receiver()->OnData(sub->cookie, kFlags, &c.value, c.error, c.low, c.high);
            continue;
        }
        if (subBatch != batch) {
            flush();
            batch = subBatch;
        }
        m_entries.push_back({sub->cookie, &c.value, c.error, c.low, c.high});
    }
    flush();
}

void Shard::Dispatch(std::unique_lock<SlimMutex> &l, Event e)
{
    Subscription *sub = e.sub;
    Member &m = *sub->member;
    switch (e.kind) {
    case EventKind::Open: {
        CadroAttributes a;
        Attributes(m, a);
        Deliver(l, [&] {
            for (uint32_t status :
                 {kCadroStatusConnecting, kCadroStatusContacted, kCadroStatusSubscribing, kCadroStatusSubscribed}) {
                if (sub->dead)
                    return;
                sub->Receiver()->StatusChange(sub->cookie, status, 0, 0);
            }
            if (!sub->dead)
                sub->Receiver()->OnAttributes(sub->cookie, &a);
        });
        if (sub->dead)
            return;
        e.kind = EventKind::Activate;
        Dispatch(l, e);
        return;
    }
    case EventKind::Status:
        if (e.status == kCadroStatusDisconnected)
            sub->active = false;
        Deliver(l, [&] { sub->Receiver()->StatusChange(sub->cookie, e.status, 0, 0); });
        return;
    case EventKind::Attributes: {
        CadroAttributes a;
        Attributes(m, a);
        Deliver(l, [&] { sub->Receiver()->OnAttributes(sub->cookie, &a); });
        return;
    }
    case EventKind::Activate:
        sub->active = true;
        Schedule(sub->member);
        [[fallthrough]];
    case EventKind::Value: {
        if (!sub->active || m.stalled || !m.hasValue || !m.machine->connected)
            return;
        CadroValue value = {};
        ToCadroValue(m.value, value);
        int32_t error = m.good ? 0 : 1;
        uint32_t low, high;
        Split(m.time, low, high);
        Deliver(l, [&] {
            if (!sub->dead)
                sub->Receiver()->OnData(sub->cookie, kCadroHasValue | kCadroHasQuality | kCadroHasTime, &value, error,
                                        low, high);
        });
        ClearCadroValue(value);
        return;
    }
    }
}

} // namespace cadrosim

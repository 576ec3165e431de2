#pragma once
// What the parts of a node link share: its limits and waits, and the
// templates by which it sends frames, asks the node and calls subscriptions.
// Included by the link's own sources only.
#include "NodeLink.h"

namespace cadrosim {
namespace link {
inline const HRESULT kUnknownUrl = HRESULT_FROM_WIN32(ERROR_NOT_FOUND);
inline const HRESULT kNotConnected = HRESULT_FROM_WIN32(ERROR_NOT_CONNECTED);
// How long a request waits for a node that is being started, and for an
// answer: generous, since a node may be busy with a large listing.
inline constexpr DWORD kStartWaitMs = 15000;
inline constexpr DWORD kReplyWaitMs = 60000;
inline constexpr DWORD kReconnectPauseMs = 500;
inline constexpr DWORD kRestartMs = 2000;
inline constexpr DWORD kTcpConnectMs = 3000;
inline constexpr uint32_t kFeedBit = 1u << 31; // on a batch entry's index: a feed's
// The most calls a batch gathers before it makes them: a read that holds
// many ticks for many subscriptions would otherwise gather them all (a
// million entries, 16 MB, kept after the subscriptions are gone).
inline constexpr size_t kCallsPerRound = 8192;
} // namespace link

template <class Fill> bool NodeLink::Send(wire::Kind kind, Fill fill)
{
    return m_state == State::Connected && m_queue.Push(kind, fill);
}

template <class Fill> bool NodeLink::Ask(wire::Kind kind, Fill fill, std::string &reply)
{
    std::unique_lock<SlimMutex> l(m_lock);
    // The link's own thread reads the answers: it cannot wait for one.
    if (OnLinkThread() || !WaitConnected(l, true))
        return false;
    Pending pending;
    uint32_t request = ++m_nextRequest ? m_nextRequest : ++m_nextRequest;
    Send(kind, [&](wire::Out &out) {
        out.U32(request);
        fill(out);
    });
    m_pending[request] = &pending;
    // Written by this thread, without the link's lock: the link's thread
    // must go on reading meanwhile.
    l.unlock();
    m_queue.Flush();
    l.lock();
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(link::kReplyWaitMs);
    while (!pending.done && std::chrono::steady_clock::now() < deadline)
        pending.wake.wait_until(l, deadline);
    m_pending.erase(request);
    if (!pending.answered)
        return false;
    reply.swap(pending.reply);
    return true;
}

template <class Call, class Note> void NodeLink::CallSubscription(uint32_t id, Call call, Note note)
{
    RemoteSubscription *sub;
    {
        std::lock_guard<SlimMutex> l(m_lock);
        sub = Lookup(id);
        if (!sub)
            return;
        note(*sub);
        sub->Pin();
    }
    CallPinned(sub, call);
}

template <class Call> void NodeLink::CallPinned(RemoteSubscription *sub, Call call)
{
    sub->Deliver(call, m_callWaiters, m_lock, m_callReturned);
    sub->Unpin();
}

template <class Call, class Note> void NodeLink::CallFeed(uint32_t feedId, Call call, Note note)
{
    // The link thread's own list, kept between calls: a new subscription's
    // feed brings five of them, and allocations from two threads meet in
    // the process heap's lock.
    std::vector<RemoteSubscription *> &members = m_batch.feedCall;
    members.clear();
    {
        std::lock_guard<SlimMutex> l(m_lock);
        LinkFeed *feed = FeedOf(feedId);
        if (!feed)
            return;
        note(*feed);
        ForEachMember(*feed, [&](RemoteSubscription *sub) {
            sub->Pin();
            members.push_back(sub);
        });
    }
    for (RemoteSubscription *sub : members)
        CallPinned(sub, call);
}

} // namespace cadrosim

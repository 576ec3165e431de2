// What the libraries ask of the node: subscriptions (without waiting when
// the node's catalogue names the member), writes, reads, listings, commands
// and descriptions.
#include "NodeLinkParts.h"

#include <algorithm>
#include <cstring>
#include <new>

namespace cadrosim {
using namespace link; // the link's own limits and waits

bool NodeLink::Catalogued(const wchar_t *url)
{
    const uint64_t hash = wire::CatalogueHash(url);
    std::unique_lock<SlimMutex> l(m_lock);
    for (;;) {
        switch (m_known.State()) {
        case KnownMembers::Catalogue::Current:
            return m_known.InCatalogue(hash);
        case KnownMembers::Catalogue::Refused:
            return false;
        case KnownMembers::Catalogue::Fetching:
            m_changed.wait(l); // the fetch always ends: Ask has a deadline
            continue;
        case KnownMembers::Catalogue::Stale:
            break;
        }
        const unsigned ticket = m_known.BeginFetch();
        l.unlock();
        std::string reply;
        bool answered = Ask(
            wire::Kind::Catalogue, [](wire::Out &) {}, reply);
        std::vector<uint64_t> hashes;
        wire::In in(reply.data(), reply.size());
        uint32_t count = answered ? in.U32() : 0;
        bool whole = answered && in.Ok() && reply.size() - 4 == uint64_t{count} * sizeof(uint64_t);
        if (whole) {
            hashes.resize(count);
            memcpy(hashes.data(), reply.data() + 4, count * sizeof(uint64_t));
        }
        l.lock();
        m_changed.notify_all();
        if (!m_known.Fetched(ticket, whole, std::move(hashes)))
            return false; // out of date on arrival; the next subscriber fetches anew
    }
}

HRESULT NodeLink::Subscribe(const wchar_t *url, void *cookie, ICadroRealTimeReceiver *receiver, CadroDataItem **out)
{
    if (!out || !receiver || !url)
        return E_POINTER;
    *out = nullptr;
    // Its own feed holds what the node tells it until it joins the node's.
    std::unique_ptr<LinkFeed> own(LinkFeed::Create(url));
    if (!own)
        return E_OUTOFMEMORY;
    // The subscription's reference and use, taken before the lock: a first
    // use starts the link.
    receiver->AddRef();
    AddUse();
    std::unique_lock<SlimMutex> l(m_lock);
    bool connected = WaitConnected(l, false);
    RemoteSubscription *sub = NewSubscription(receiver, cookie);
    if (!sub) {
        l.unlock();
        receiver->Release();
        ReleaseUse();
        return E_OUTOFMEMORY;
    }
    AddMember(*own.release(), sub);
    if (!connected) {
        // The node is away: the subscription waits for it, as one on a
        // disconnected machine does.
        uint32_t id = sub->id;
        l.unlock();
        *out = sub;
        CallSubscription(
            id, [](RemoteSubscription &s) { s.Receiver()->StatusChange(s.cookie, kCadroStatusConnecting, 0, 0); });
        return S_OK;
    }
    bool known = OnLinkThread() || m_known.Listed(wire::UrlHash(url));
    if (!known) {
        l.unlock();
        known = Catalogued(url);
        l.lock();
    }
    if (known) {
        Send(wire::Kind::Subscribe, [&](wire::Out &o) {
            o.U32(0);
            o.U32(sub->id);
            o.Text(url);
        });
        *out = sub;
        return S_OK;
    }
    l.unlock();
    // Not confirmed by a listing: the node's answer decides.
    std::string reply;
    bool answered = Ask(
        wire::Kind::Subscribe,
        [&](wire::Out &o) {
            o.U32(sub->id);
            o.Text(url);
        },
        reply);
    wire::In in(reply.data(), reply.size());
    HRESULT hr = answered ? static_cast<HRESULT>(in.U32()) : S_OK;
    if (SUCCEEDED(hr) || !in.Ok()) {
        *out = sub; // unanswered: subscribed again when the link is back
        return S_OK;
    }
    l.lock();
    Forget(sub, l);
    l.unlock();
    sub->Unpin();
    return hr;
}

void NodeLink::Forget(RemoteSubscription *sub, std::unique_lock<SlimMutex> &l)
{
    RemoveMember(sub);
    Unregister(sub);
    sub->Forgotten();
    if (m_delivering) {
        // The batch of values under way may still look at it.
        sub->Pin();
        m_graveyard.push_back(sub);
    }
    // The link's thread never waits: the call under way elsewhere keeps the
    // object pinned, and a call of its own is further up its stack.
    if (OnLinkThread())
        return;
    ++m_callWaiters;
    m_callReturned.wait(l, [&] { return sub->Returned() && m_callingSub.load() != sub; });
    --m_callWaiters;
}

void NodeLink::Unsubscribe(RemoteSubscription *sub)
{
    std::unique_lock<SlimMutex> l(m_lock);
    uint32_t id = sub->id;
    Send(wire::Kind::Unsubscribe, [&](wire::Out &out) { out.U32(id); });
    Forget(sub, l);
    l.unlock();
    sub->Unpin(); // deleted now, or by the last delivery that holds it
}

HRESULT NodeLink::Write(RemoteSubscription *sub, const CadroValue *value)
{
    if (!value)
        return E_POINTER;
    std::unique_lock<SlimMutex> l(m_lock);
    WaitConnected(l, false);
    bool sent = Send(wire::Kind::Write, [&](wire::Out &out) {
        out.U32(sub->id);
        out.Value(*value);
    });
    return sent ? S_OK : kNotConnected;
}

HRESULT NodeLink::Read(RemoteSubscription *sub, uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time)
{
    if (!flags || !value || !errorFlag || !time)
        return E_POINTER;
    *flags = 0;
    *errorFlag = 0;
    *time = {};
    value->type = kCadroCleared;
    value->number = 0;
    std::unique_lock<SlimMutex> l(m_lock);
    if (!WaitConnected(l, false))
        return kNotConnected;
    return sub->Recall(flags, value, errorFlag, time);
}

bool NodeLink::Browse(const std::wstring &url, std::vector<BrowseEntry> &out)
{
    out.clear();
    std::string reply;
    if (!Ask(
            wire::Kind::List, [&](wire::Out &o) { o.Text(url); }, reply))
        return false;
    wire::In in(reply.data(), reply.size());
    bool found = in.U8() != 0;
    uint32_t count = in.U32();
    std::vector<uint64_t> known;
    uint64_t urlHash = wire::UrlHash(url);
    for (uint32_t i = 0; i < count && in.Ok(); ++i) {
        BrowseEntry e;
        e.name = in.Text();
        e.kind = static_cast<wchar_t>(in.U16());
        e.leaf = in.U8() != 0;
        e.dataType = in.U16();
        e.access = in.U16();
        if (in.U8())
            known.push_back(wire::MemberUrlHash(urlHash, e.name));
        out.push_back(std::move(e));
    }
    if (!in.Ok()) {
        out.clear();
        return false;
    }
    std::lock_guard<SlimMutex> l(m_lock);
    m_known.AddListed(known);
    return found;
}

std::wstring NodeLink::Execute(const std::wstring &command)
{
    AddUse();
    std::string reply;
    bool answered = Ask(
        wire::Kind::Execute, [&](wire::Out &o) { o.Text(command); }, reply);
    ReleaseUse();
    if (!answered)
        return L"error: the network node does not answer\n";
    wire::In in(reply.data(), reply.size());
    std::wstring answer = in.Text();
    return in.Ok() ? answer : L"error: the network node's answer is garbled\n";
}

bool NodeLink::Load(const std::wstring &description, std::wstring &error)
{
    std::string reply;
    AddUse();
    bool answered = Ask(
        wire::Kind::Load, [&](wire::Out &o) { o.Text(description); }, reply);
    ReleaseUse();
    if (!answered) {
        error = L"the network node does not answer";
        return false;
    }
    wire::In in(reply.data(), reply.size());
    bool loaded = in.U8() != 0;
    error = in.Text();
    return in.Ok() && loaded;
}

bool NodeLink::Knows(const std::wstring &url)
{
    std::lock_guard<SlimMutex> l(m_lock);
    return m_known.Listed(wire::UrlHash(url));
}

void NodeLink::AddBrowserReceiver(ICadroBrowserReceiver *receiver)
{
    std::lock_guard<SlimMutex> l(m_lock);
    receiver->AddRef();
    m_browserReceivers.push_back(receiver);
}

void NodeLink::RemoveBrowserReceiver(ICadroBrowserReceiver *receiver)
{
    std::lock_guard<SlimMutex> l(m_lock);
    for (auto it = m_browserReceivers.begin(); it != m_browserReceivers.end(); ++it)
        if (*it == receiver) {
            m_browserReceivers.erase(it);
            receiver->Release();
            return;
        }
}

} // namespace cadrosim

#include "NodeLink.h"

#include "PipeChannel.h"
#include "Prefetch.h"
#include "SimValue.h"
#include "SocketChannel.h"

#include <algorithm>
#include <cstring>
#include <new>
#include <utility>

namespace cadrosim {

namespace {
const HRESULT kUnknownUrl = HRESULT_FROM_WIN32(ERROR_NOT_FOUND);
const HRESULT kNotConnected = HRESULT_FROM_WIN32(ERROR_NOT_CONNECTED);
constexpr uint32_t kSlotBits = 22;
constexpr uint32_t kSlotMask = (1u << kSlotBits) - 1;
// How long a request waits for a node that is being started, and for an
// answer: generous, since a node may be busy with a large listing.
constexpr DWORD kStartWaitMs = 15000;
constexpr DWORD kReplyWaitMs = 60000;
constexpr DWORD kReconnectPauseMs = 500;
constexpr DWORD kRestartMs = 2000;
constexpr DWORD kTcpConnectMs = 3000;
constexpr size_t kMostKnownUrls = 4u << 20;
constexpr uint32_t kFeedBit = 1u << 31; // on a batch entry's index: a feed's

std::wstring NodeProgramPath()
{
    HMODULE self = nullptr;
    GetModuleHandleExW(GET_MODULE_HANDLE_EX_FLAG_FROM_ADDRESS | GET_MODULE_HANDLE_EX_FLAG_UNCHANGED_REFCOUNT,
                       reinterpret_cast<LPCWSTR>(&NodeProgramPath), &self);
    wchar_t path[MAX_PATH * 2];
    DWORD n = GetModuleFileNameW(self, path, MAX_PATH * 2);
    std::wstring text(path, n < MAX_PATH * 2 ? n : 0);
    size_t slash = text.find_last_of(L"\\/");
    return (slash == std::wstring::npos ? std::wstring() : text.substr(0, slash + 1)) + L"cadronode.exe";
}

void StartNode()
{
    // The node outlives whoever started it: it must not keep (or write to)
    // the standard handles of that program, whose reader may be long gone.
    // They are the null device, and nothing else is inherited.
    SECURITY_ATTRIBUTES inheritable = {sizeof inheritable, nullptr, TRUE};
    HANDLE nul = CreateFileW(L"NUL", GENERIC_READ | GENERIC_WRITE, FILE_SHARE_READ | FILE_SHARE_WRITE, &inheritable,
                             OPEN_EXISTING, 0, nullptr);
    if (nul == INVALID_HANDLE_VALUE)
        return;
    SIZE_T size = 0;
    InitializeProcThreadAttributeList(nullptr, 1, 0, &size);
    std::vector<char> attributes(size);
    auto *list = reinterpret_cast<LPPROC_THREAD_ATTRIBUTE_LIST>(attributes.data());
    bool limited =
        size && InitializeProcThreadAttributeList(list, 1, 0, &size) &&
        UpdateProcThreadAttribute(list, 0, PROC_THREAD_ATTRIBUTE_HANDLE_LIST, &nul, sizeof nul, nullptr, nullptr);
    STARTUPINFOEXW startup = {};
    startup.StartupInfo.cb = sizeof startup;
    startup.StartupInfo.dwFlags = STARTF_USESTDHANDLES;
    startup.StartupInfo.hStdInput = startup.StartupInfo.hStdOutput = startup.StartupInfo.hStdError = nul;
    startup.lpAttributeList = limited ? list : nullptr;
    std::wstring command = L"\"" + NodeProgramPath() + L"\"";
    PROCESS_INFORMATION process = {};
    DWORD flags = DETACHED_PROCESS | CREATE_NEW_PROCESS_GROUP | (limited ? EXTENDED_STARTUPINFO_PRESENT : 0);
    if (CreateProcessW(nullptr, command.data(), nullptr, nullptr, TRUE, flags, nullptr, nullptr, &startup.StartupInfo,
                       &process)) {
        CloseHandle(process.hThread);
        CloseHandle(process.hProcess);
    }
    if (limited)
        DeleteProcThreadAttributeList(list);
    CloseHandle(nul);
}
} // namespace

// ---- RemoteSubscription ------------------------------------------------------

RemoteSubscription *RemoteSubscription::Create(uint8_t link, const wchar_t *url, ICadroRealTimeReceiver *receiver,
                                               void *cookie)
{
    size_t length = wcslen(url);
    if (length > UINT32_MAX / 4)
        return nullptr;
    bool narrow = std::all_of(url, url + length, [](wchar_t c) { return c < 0x80; });
    void *block = operator new(sizeof(RemoteSubscription), narrow ? length : length * sizeof(wchar_t));
    return block ? ::new (block) RemoteSubscription(link, receiver, cookie, url, length, narrow) : nullptr;
}

void *RemoteSubscription::operator new(size_t size, size_t urlBytes)
{
    return ::operator new(size + urlBytes, std::nothrow);
}

void RemoteSubscription::operator delete(void *p)
{
    ::operator delete(p);
}

RemoteSubscription::RemoteSubscription(uint8_t link, ICadroRealTimeReceiver *r, void *c, const wchar_t *url,
                                       size_t length, bool narrow)
    : receiver(r), cookie(c), m_urlLength(static_cast<uint32_t>(length)), m_urlNarrow(narrow), m_link(link)
{
    char *stored = reinterpret_cast<char *>(this + 1);
    if (narrow)
        std::transform(url, url + length, stored, [](wchar_t ch) { return static_cast<char>(ch); });
    else
        memcpy(stored, url, length * sizeof(wchar_t));
    receiver->AddRef();
    Link().AddUse();
}

NodeLink &RemoteSubscription::Link() const
{
    return NodeLink::At(m_link);
}

std::wstring RemoteSubscription::Url() const
{
    const char *stored = reinterpret_cast<const char *>(this + 1);
    if (m_urlNarrow)
        return std::wstring(stored, stored + m_urlLength);
    return std::wstring(reinterpret_cast<const wchar_t *>(stored), m_urlLength);
}

RemoteSubscription::~RemoteSubscription()
{
    receiver->Release();
    Link().ReleaseUse();
}

HRESULT RemoteSubscription::Recall(uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time) const
{
    return feed->mirror.Recall(flags, value, errorFlag, time);
}

void RemoteSubscription::Delete()
{
    delete this;
}

HRESULT STDMETHODCALLTYPE RemoteSubscription::Write(const CadroValue *value)
{
    return Link().Write(this, value);
}

HRESULT STDMETHODCALLTYPE RemoteSubscription::Read(uint32_t *flags, CadroValue *value, int32_t *errorFlag,
                                                   FILETIME *time)
{
    return Link().Read(this, flags, value, errorFlag, time);
}

void RemoteSubscription::LastRelease()
{
    Link().Unsubscribe(this);
}

// ---- NodeLink: lifetime --------------------------------------------------------

namespace {
// Every link of the process, by index (0: this machine's node). Never
// destroyed, like the engine: their threads may outlive static destruction
// at process exit.
struct Links {
    SlimMutex lock;
    NodeLink *at[256] = {};
    unsigned count = 0;
};

Links &AllLinks()
{
    static Links *links = new Links();
    return *links;
}
} // namespace

NodeLink &NodeLink::Instance()
{
    static NodeLink *link = [] {
        Links &links = AllLinks();
        std::lock_guard<SlimMutex> l(links.lock);
        if (!links.at[0])
            links.at[0] = new NodeLink(0, L"");
        links.count = std::max(links.count, 1u);
        return links.at[0];
    }();
    return *link;
}

NodeLink *NodeLink::ForAddress(const std::wstring &address)
{
    Instance(); // index 0 is the machine's node
    Links &links = AllLinks();
    std::lock_guard<SlimMutex> l(links.lock);
    for (unsigned i = 1; i < links.count; ++i)
        if (links.at[i]->m_address == address)
            return links.at[i];
    if (links.count == 256)
        return nullptr;
    NodeLink *link = new (std::nothrow) NodeLink(static_cast<uint8_t>(links.count), address);
    if (link)
        links.at[links.count++] = link;
    return link;
}

NodeLink &NodeLink::At(uint8_t index)
{
    return *AllLinks().at[index];
}

void NodeLink::AddUse()
{
    std::unique_lock<SlimMutex> l(m_lock);
    if (m_uses++ == 0)
        Start();
}

void NodeLink::ReleaseUse()
{
    std::unique_lock<SlimMutex> l(m_lock);
    if (--m_uses == 0)
        Stop(l);
}

void NodeLink::Start()
{
    // Threads of an earlier use that stopped from inside a callback may
    // still be finishing: they were detached, and end on their own.
    unsigned generation = ++m_generation;
    m_state = State::Connecting;
    if (!m_wake)
        m_wake = CreateEventW(nullptr, FALSE, FALSE, nullptr);
    m_thread = std::thread([this, generation] { Run(generation); });
}

void NodeLink::Stop(std::unique_lock<SlimMutex> &l)
{
    ++m_generation;
    std::shared_ptr<Channel> channel = m_channel;
    std::thread thread = std::move(m_thread);
    l.unlock();
    // What was said last (a write, unsubscriptions) reaches the node before
    // the pipe closes.
    m_queue.Stop(true);
    if (channel)
        channel->Close();
    SetEvent(m_wake);
    m_changed.notify_all();
    if (thread.joinable()) {
        if (thread.get_id() == std::this_thread::get_id())
            thread.detach(); // the last use ended inside a callback
        else
            thread.join();
    }
    l.lock();
    if (m_uses == 0)
        m_state = State::Stopped;
}

// ---- NodeLink: the connection ----------------------------------------------------

std::unique_ptr<Channel> NodeLink::Connect(bool mayStart, unsigned generation)
{
    if (!m_address.empty())
        return SocketChannel::Connect(m_address, kTcpConnectMs);
    DWORD begin = GetTickCount();
    DWORD lastStart = 0;
    bool started = false;
    for (;;) {
        HANDLE pipe = CreateFileW(wire::NodePipeName(), GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING,
                                  FILE_FLAG_OVERLAPPED, nullptr);
        if (pipe != INVALID_HANDLE_VALUE)
            return std::make_unique<PipeChannel>(pipe);
        DWORD error = GetLastError();
        if (error == ERROR_PIPE_BUSY) {
            WaitNamedPipeW(wire::NodePipeName(), 200);
        } else {
            // A node that is still shutting down makes a new one give way:
            // started again while none appears.
            if (mayStart && error == ERROR_FILE_NOT_FOUND && (!started || GetTickCount() - lastStart > kRestartMs)) {
                StartNode();
                started = true;
                lastStart = GetTickCount();
            }
            // No node and none to be started: give up at once. Any other
            // refusal (an instance of a node that is closing) passes.
            if (!started && error == ERROR_FILE_NOT_FOUND)
                return nullptr;
            if (WaitForSingleObject(m_wake, 20) == WAIT_OBJECT_0)
                return nullptr;
        }
        {
            std::lock_guard<SlimMutex> l(m_lock);
            if (m_generation != generation)
                return nullptr;
        }
        if (GetTickCount() - begin > kStartWaitMs)
            return nullptr;
    }
}

void NodeLink::Run(unsigned generation)
{
    m_linkThreadId = GetCurrentThreadId();
    for (;;) {
        bool mayStart;
        {
            std::lock_guard<SlimMutex> l(m_lock);
            if (m_generation != generation)
                return;
            mayStart = m_mayStartNode;
        }
        std::shared_ptr<Channel> channel = Connect(mayStart, generation);
        {
            std::lock_guard<SlimMutex> l(m_lock);
            if (m_generation != generation)
                return;
            if (channel) {
                m_channel = channel;
                m_queue.Attach(channel);
                m_state = State::Connected;
                m_mayStartNode = true;
                // Every subscription again, under the same identifiers.
                for (RemoteSubscription *sub : m_slots)
                    if (sub)
                        Send(wire::Kind::Subscribe, [&](wire::Out &out) {
                            out.U32(0);
                            out.U32(sub->id);
                            out.Text(sub->Url());
                        });
            } else if (mayStart == m_mayStartNode) {
                m_state = State::Down;
                m_lastFailure = GetTickCount();
            } else {
                continue; // a request needs a node now: start one
            }
        }
        m_changed.notify_all();
        if (channel) {
            Serve(*channel);
            Disconnected();
        }
        WaitForSingleObject(m_wake, kReconnectPauseMs);
    }
}

void NodeLink::Serve(Channel &channel)
{
    std::string buffer;
    size_t consumed = 0;
    bool fine = true;
    while (fine && channel.Read(buffer)) {
        fine = wire::TakeFrames(buffer, consumed, [&](wire::Kind kind, wire::In in) { Dispatch(kind, in); });
        DeliverData();
    }
    DeliverData();
    channel.Close();
}

void NodeLink::Disconnected()
{
    std::vector<uint32_t> ids;
    {
        std::lock_guard<SlimMutex> l(m_lock);
        m_channel.reset();
        m_queue.Detach();
        if (m_state == State::Connected)
            m_state = State::Down;
        m_knownUrls.Clear();
        ForgetCatalogue();
        for (auto &entry : m_pending)
            entry.second->done = true; // unanswered
        m_pending.clear();
        DropFeeds(); // the node's feeds are the connection's
        // Told once, however often a connection fails before the node is
        // back.
        for (RemoteSubscription *sub : m_slots)
            if (sub && sub->Connected())
                ids.push_back(sub->id);
    }
    m_changed.notify_all();
    for (uint32_t id : ids)
        CallSubscription(
            id, [](RemoteSubscription &sub) { sub.receiver->StatusChange(sub.cookie, kCadroStatusDisconnected, 0, 0); },
            [](RemoteSubscription &sub) { sub.feed->mirror.RememberStatus(kCadroStatusDisconnected); });
}

bool NodeLink::WaitConnected(std::unique_lock<SlimMutex> &l, bool forAnswer)
{
    // A node shut down on purpose is not started again by the link alone,
    // but a request that needs the network starts one; and a request does
    // not wait for the link's next attempt, unless one failed just now.
    if (m_state == State::Down && (!m_mayStartNode || GetTickCount() - m_lastFailure > kRestartMs)) {
        m_mayStartNode = true;
        m_state = State::Connecting;
        SetEvent(m_wake);
    }
    // Another machine's node is not waited for unless an answer is needed:
    // its subscriptions wait as on a disconnected machine, and the machine's
    // own servers are not held up by one that cannot be reached.
    bool wait = forAnswer || m_address.empty();
    if (wait && m_state == State::Connecting && !OnLinkThread()) {
        // Only then the clock: every read of every item comes this way.
        auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kStartWaitMs);
        while (m_state == State::Connecting && std::chrono::steady_clock::now() < deadline)
            m_changed.wait_until(l, deadline);
    }
    return m_state == State::Connected;
}

// ---- NodeLink: frames from the node -----------------------------------------------

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
    std::vector<RemoteSubscription *> &members = m_feedCall;
    members.clear();
    {
        std::lock_guard<SlimMutex> l(m_lock);
        LinkFeed *feed = FeedOf(feedId);
        if (!feed)
            return;
        note(*feed);
        feed->ForEachMember([&](RemoteSubscription *sub) {
            sub->Pin();
            members.push_back(sub);
        });
    }
    for (RemoteSubscription *sub : members)
        CallPinned(sub, call);
}

LinkFeed *NodeLink::FeedOf(uint32_t feedId) const
{
    uint32_t slot = (feedId & wire::kFeedSlotMask) - 1;
    if (slot >= m_feeds.size() || !m_feeds[slot] || m_feeds[slot]->id != feedId)
        return nullptr;
    return m_feeds[slot];
}

void NodeLink::Join(uint32_t id, uint32_t feedId)
{
    RemoteSubscription *sub = Lookup(id);
    uint32_t slot = (feedId & wire::kFeedSlotMask) - 1;
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
        feed = new (std::nothrow) LinkFeed();
        if (!feed)
            return; // the subscription goes on in the feed it has
        feed->id = feedId;
        feed->mirror.CopyFrom(current->mirror);
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
        m_feeds[(feed->id & wire::kFeedSlotMask) - 1] = nullptr;
    delete feed;
}

void NodeLink::Unshare(LinkFeed &feed)
{
    // The first member keeps the feed, the others take copies (they share
    // it still when memory is short).
    feed.id = 0;
    while (!feed.Alone()) {
        auto *own = new (std::nothrow) LinkFeed();
        if (!own)
            return;
        RemoteSubscription *sub = feed.others->back();
        own->mirror.CopyFrom(feed.mirror);
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

void NodeLink::TakeData(wire::In &in, bool feeds)
{
    DataFields f;
    f.flags = in.U32();
    in.Value(f.value);
    f.error = static_cast<int32_t>(in.U32());
    f.low = in.U32();
    f.high = in.U32();
    auto index = static_cast<uint32_t>(m_batchFields.size());
    m_batchFields.push_back(f);
    uint32_t tagged = index | (feeds ? kFeedBit : 0);
    while (in.Ok() && !in.AtEnd()) {
        uint32_t id = in.U32();
        if (in.Ok())
            m_batchIds.emplace_back(id, tagged);
    }
}

void NodeLink::PrefetchFeed(size_t i) const
{
    // The feed's place in the table a few entries before the feed itself.
    auto slotOf = [&](size_t at) { return (m_batchIds[at].first & wire::kFeedSlotMask) - 1; };
    if (i + kPrefetchAhead < m_batchIds.size() && (m_batchIds[i + kPrefetchAhead].second & kFeedBit) &&
        slotOf(i + kPrefetchAhead) < m_feeds.size())
        __builtin_prefetch(&m_feeds[slotOf(i + kPrefetchAhead)]);
    if (i < m_batchIds.size() && (m_batchIds[i].second & kFeedBit) && slotOf(i) < m_feeds.size())
        PrefetchObject(m_feeds[slotOf(i)]);
}

void NodeLink::DeliverData()
{
    if (m_batchFields.empty())
        return;
    {
        std::lock_guard<SlimMutex> l(m_lock);
        m_delivering = true;
        for (size_t i = 0; i < m_batchIds.size(); ++i) {
            PrefetchFeed(i + kPrefetchAhead);
            auto [id, tagged] = m_batchIds[i];
            uint32_t index = tagged & ~kFeedBit;
            const DataFields &f = m_batchFields[index];
            if (tagged & kFeedBit) {
                // A feed's value: remembered once, for all its members.
                if (LinkFeed *feed = FeedOf(id)) {
                    feed->mirror.Remember(f.flags, f.value, f.error, f.low, f.high);
                    feed->ForEachMember([&](RemoteSubscription *sub) { m_batchSubs.emplace_back(sub, index); });
                }
            } else if (RemoteSubscription *sub = Lookup(id)) {
                sub->feed->mirror.Remember(f.flags, f.value, f.error, f.low, f.high);
                m_batchSubs.emplace_back(sub, index);
            }
        }
    }
    // No pins: a subscription let go during the batch is deleted after it
    // (Forget), and the one being called is published first, so that its
    // holder either is seen here or sees the call and waits for it.
    for (size_t i = 0; i < m_batchSubs.size(); ++i) {
        if (i + kPrefetchAhead < m_batchSubs.size())
            PrefetchObject(m_batchSubs[i + kPrefetchAhead].first);
        auto [sub, index] = m_batchSubs[i];
        m_callingSub.store(sub);
        if (!sub->IsForgotten()) {
            const DataFields &f = m_batchFields[index];
            sub->receiver->OnData(sub->cookie, f.flags, &f.value, f.error, f.low, f.high);
        }
        if (m_callWaiters.load() != 0)
            WakeWaiters(nullptr);
    }
    WakeWaiters(nullptr);
    std::vector<RemoteSubscription *> graveyard;
    {
        std::lock_guard<SlimMutex> l(m_lock);
        m_delivering = false;
        graveyard.swap(m_graveyard);
    }
    for (RemoteSubscription *sub : graveyard)
        sub->Unpin();
    for (DataFields &f : m_batchFields)
        ClearCadroValue(f.value);
    m_batchFields.clear();
    m_batchIds.clear();
    m_batchSubs.clear();
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
            CallSubscription(id, [&](RemoteSubscription &sub) { sub.receiver->OnAttributes(sub.cookie, &a); });
        return;
    }
    case wire::Kind::Status: {
        uint32_t id = in.U32();
        uint32_t status = in.U32();
        if (in.Ok())
            CallSubscription(
                id, [&](RemoteSubscription &sub) { sub.receiver->StatusChange(sub.cookie, status, 0, 0); },
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
                feedId, [&](RemoteSubscription &sub) { sub.receiver->OnAttributes(sub.cookie, &a); },
                [](LinkFeed &) {});
        return;
    }
    case wire::Kind::FeedStatus: {
        uint32_t feedId = in.U32();
        uint32_t status = in.U32();
        if (in.Ok())
            CallFeed(
                feedId, [&](RemoteSubscription &sub) { sub.receiver->StatusChange(sub.cookie, status, 0, 0); },
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
            it->second->done = true;
            m_pending.erase(it);
        }
        m_changed.notify_all();
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
        m_knownUrls.Clear();
        ForgetCatalogue();
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

void NodeLink::ForgetCatalogue()
{
    std::vector<uint64_t>().swap(m_catalogue);
    m_catalogueState = CatalogueState::Stale;
    ++m_catalogueEpoch;
}

bool NodeLink::Catalogued(const wchar_t *url)
{
    const uint64_t hash = wire::CatalogueHash(url);
    std::unique_lock<SlimMutex> l(m_lock);
    for (;;) {
        switch (m_catalogueState) {
        case CatalogueState::Current:
            return std::binary_search(m_catalogue.begin(), m_catalogue.end(), hash);
        case CatalogueState::Refused:
            return false;
        case CatalogueState::Fetching:
            m_changed.wait(l); // the fetch always ends: Ask has a deadline
            continue;
        case CatalogueState::Stale:
            break;
        }
        m_catalogueState = CatalogueState::Fetching;
        const unsigned epoch = m_catalogueEpoch;
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
            if (!std::is_sorted(hashes.begin(), hashes.end()))
                std::sort(hashes.begin(), hashes.end());
        }
        l.lock();
        m_changed.notify_all();
        if (epoch != m_catalogueEpoch)
            return false; // out of date on arrival; the next subscriber fetches anew
        m_catalogueState = whole ? CatalogueState::Current : CatalogueState::Refused;
        m_catalogue.swap(hashes);
    }
}

// ---- NodeLink: requests -------------------------------------------------------------

uint32_t NodeLink::Register(RemoteSubscription *sub)
{
    uint32_t slot;
    if (!m_freeSlots.empty()) {
        slot = m_freeSlots.back();
        m_freeSlots.pop_back();
    } else {
        if (m_slots.size() >= kSlotMask)
            return 0;
        slot = static_cast<uint32_t>(m_slots.size());
        m_slots.push_back(nullptr);
        m_generations.push_back(0);
    }
    m_slots[slot] = sub;
    // The generation tells a new subscription from an older one of the
    // same slot whose values may still be on their way.
    sub->id = (static_cast<uint32_t>(m_generations[slot] & 0x3ff) << kSlotBits) | (slot + 1);
    return sub->id;
}

void NodeLink::Unregister(RemoteSubscription *sub)
{
    uint32_t slot = (sub->id & kSlotMask) - 1;
    m_slots[slot] = nullptr;
    ++m_generations[slot];
    m_freeSlots.push_back(slot);
}

RemoteSubscription *NodeLink::Lookup(uint32_t id) const
{
    uint32_t slot = (id & kSlotMask) - 1;
    if (slot >= m_slots.size() || !m_slots[slot] || m_slots[slot]->id != id)
        return nullptr;
    return m_slots[slot];
}

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
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kReplyWaitMs);
    while (!pending.done && std::chrono::steady_clock::now() < deadline)
        m_changed.wait_until(l, deadline);
    m_pending.erase(request);
    if (!pending.answered)
        return false;
    reply.swap(pending.reply);
    return true;
}

HRESULT NodeLink::Subscribe(const wchar_t *url, void *cookie, ICadroRealTimeReceiver *receiver, CadroDataItem **out)
{
    if (!out || !receiver || !url)
        return E_POINTER;
    *out = nullptr;
    RemoteSubscription *sub = RemoteSubscription::Create(m_index, url, receiver, cookie);
    if (!sub)
        return E_OUTOFMEMORY;
    // Its own feed holds what the node tells it until it joins the node's.
    auto *own = new (std::nothrow) LinkFeed();
    std::unique_lock<SlimMutex> l(m_lock);
    bool connected = WaitConnected(l, false);
    if (!own || !Register(sub)) {
        l.unlock();
        delete own;
        sub->Delete();
        return E_OUTOFMEMORY;
    }
    AddMember(*own, sub);
    if (!connected) {
        // The node is away: the subscription waits for it, as one on a
        // disconnected machine does.
        uint32_t id = sub->id;
        l.unlock();
        *out = sub;
        CallSubscription(
            id, [](RemoteSubscription &s) { s.receiver->StatusChange(s.cookie, kCadroStatusConnecting, 0, 0); });
        return S_OK;
    }
    bool known = OnLinkThread() || m_knownUrls.Contains(wire::UrlHash(url));
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
    if (m_knownUrls.Size() + known.size() > kMostKnownUrls)
        m_knownUrls.Clear();
    for (uint64_t hash : known)
        m_knownUrls.Insert(hash);
    return found;
}

std::wstring NodeLink::Execute(const std::wstring &command)
{
    std::string reply;
    if (!Ask(
            wire::Kind::Execute, [&](wire::Out &o) { o.Text(command); }, reply))
        return L"error: the network node does not answer\n";
    wire::In in(reply.data(), reply.size());
    std::wstring answer = in.Text();
    return in.Ok() ? answer : L"error: the network node's answer is garbled\n";
}

bool NodeLink::Load(const std::wstring &description, std::wstring &error)
{
    std::string reply;
    if (!Ask(
            wire::Kind::Load, [&](wire::Out &o) { o.Text(description); }, reply)) {
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
    return m_knownUrls.Contains(wire::UrlHash(url));
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

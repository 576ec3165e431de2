#include "Engine.h"

#include "FixedPool.h"
#include "NetworkFile.h"
#include "NodeLink.h"

#include <algorithm>

namespace cadrosim {

namespace {
constexpr unsigned kShardCount = 2;
const HRESULT kUnknownUrl = HRESULT_FROM_WIN32(ERROR_NOT_FOUND);
const HRESULT kNotConnected = HRESULT_FROM_WIN32(ERROR_NOT_CONNECTED);

// The description a user named: environment variable CADRO_NETWORK_FILE, else
// the registry value "Network File" of HKLM\Software\Tarnwell\Cadro Simulator.
std::wstring NetworkFilePath()
{
    wchar_t path[MAX_PATH * 2];
    DWORD n = GetEnvironmentVariableW(L"CADRO_NETWORK_FILE", path, MAX_PATH * 2);
    if (n > 0 && n < MAX_PATH * 2)
        return path;
    DWORD size = sizeof path;
    if (RegGetValueW(HKEY_LOCAL_MACHINE, L"Software\\Tarnwell\\Cadro Simulator", L"Network File", RRF_RT_REG_SZ,
                     nullptr, path, &size) == ERROR_SUCCESS)
        return path;
    return L"";
}

// A node's topology changes are this engine's too when it serves them.
class TopologyRelay : public CSimUnknown<ICadroBrowserReceiver> {
public:
    explicit TopologyRelay(Engine &engine) : m_engine(engine) {}
    HRESULT STDMETHODCALLTYPE BrowseItemChanged() override
    {
        m_engine.NotifyTopologyChanged();
        return S_OK;
    }

private:
    Engine &m_engine;
};

// The machine a URL begins with: "\\name\..." gives name.
std::wstring MachineOf(const std::wstring &url)
{
    if (url.compare(0, 2, L"\\\\") != 0)
        return L"";
    size_t end = url.find(L'\\', 2);
    return url.substr(2, end == std::wstring::npos ? std::wstring::npos : end - 2);
}
} // namespace

// Asked once per subscription (to expand "\\.\"): read from the system once,
// since GetComputerNameW reads the registry each time.
const std::wstring &LocalHostName()
{
    static const std::wstring host = [] {
        wchar_t name[MAX_COMPUTERNAME_LENGTH + 1];
        DWORD size = MAX_COMPUTERNAME_LENGTH + 1;
        return GetComputerNameW(name, &size) ? std::wstring(name, size) : std::wstring(L"LOCALHOST");
    }();
    return host;
}

bool ReadTextFile(const std::wstring &path, std::wstring &text)
{
    HANDLE file = CreateFileW(path.c_str(), GENERIC_READ, FILE_SHARE_READ, nullptr, OPEN_EXISTING, 0, nullptr);
    if (file == INVALID_HANDLE_VALUE)
        return false;
    std::string bytes;
    char buffer[65536];
    DWORD got = 0;
    while (ReadFile(file, buffer, sizeof buffer, &got, nullptr) && got > 0)
        bytes.append(buffer, got);
    CloseHandle(file);
    int n = MultiByteToWideChar(CP_UTF8, 0, bytes.data(), static_cast<int>(bytes.size()), nullptr, 0);
    text.assign(n, L'\0');
    MultiByteToWideChar(CP_UTF8, 0, bytes.data(), static_cast<int>(bytes.size()), text.data(), n);
    return true;
}

namespace {
FixedPool<Subscription, 1024> &SubscriptionPool()
{
    static FixedPool<Subscription, 1024> pool;
    return pool;
}
} // namespace

void *Subscription::operator new(size_t size, const std::nothrow_t &) noexcept
{
    return size == sizeof(Subscription) ? SubscriptionPool().Allocate() : nullptr;
}

void Subscription::operator delete(void *place) noexcept
{
    SubscriptionPool().Free(place);
}

void Subscription::operator delete(void *place, const std::nothrow_t &) noexcept
{
    operator delete(place);
}

Subscription::Subscription(MemberPtr m, ICadroRealTimeReceiver *r, BatchReceiver *batch, void *c)
    : member(std::move(m)), cookie(c),
      m_target(batch ? reinterpret_cast<uintptr_t>(batch) | kBatched : reinterpret_cast<uintptr_t>(r))
{
    static_assert(sizeof(void *) != 8 || sizeof(Subscription) == 48, "a subscription is 48 bytes");
    static_assert(alignof(BatchReceiver) > kBatched, "a batch interface's address leaves the tag bit free");
    r->AddRef();
    Engine::Instance().AddUse();
}

Subscription::~Subscription()
{
    if (ICadroRealTimeReceiver *receiver = TakeReceiver())
        receiver->Release();
    Engine::Instance().ReleaseUse();
}

ICadroRealTimeReceiver *Subscription::TakeReceiver()
{
    ICadroRealTimeReceiver *receiver = Receiver();
    m_target = 0;
    return receiver;
}

HRESULT STDMETHODCALLTYPE Subscription::Write(const CadroValue *value)
{
    return Engine::Instance().Write(this, value);
}

HRESULT STDMETHODCALLTYPE Subscription::Read(uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time)
{
    return Engine::Instance().Read(this, flags, value, errorFlag, time);
}

void Subscription::LastRelease()
{
    Engine::Instance().Unsubscribe(this);
}

Engine &Engine::Instance()
{
    // Never destroyed: threads still running at process exit must not meet a
    // destroyed engine, and a DLL must not join threads while unloading.
    static Engine *engine = new Engine();
    return *engine;
}

Engine::Engine() : m_topologyRelay(new TopologyRelay(*this)), m_epoch(std::chrono::steady_clock::now()), m_random(12345)
{
    for (unsigned i = 0; i < kShardCount; ++i)
        m_shards.push_back(std::make_unique<Shard>(*this));
    LoadInitialNetwork();
}

void Engine::LoadInitialNetwork()
{
    std::wstring path = NetworkFilePath();
    std::wstring text;
    if (path.empty()) {
        m_networkSource = L"built-in default network";
        text = DefaultNetworkDescription();
    } else if (ReadTextFile(path, text)) {
        m_networkSource = path;
    } else {
        m_networkSource = path;
        Load(L"", text);
        m_loadError = L"cannot read " + path;
        return;
    }
    std::wstring error;
    if (!Load(text, error)) {
        // An empty network rather than a guess; "cadroctl status" tells why.
        Load(L"", text);
        m_loadError = path + L": " + error;
    }
}

bool Engine::Load(const std::wstring &description, std::wstring &error)
{
    auto network = std::make_unique<Network>(LocalHostName());
    if (!ParseNetworkDescription(description, LocalHostName(), *network, error))
        return false;
    std::vector<NodeLink *> remote;
    for (auto &machine : network->Machines())
        if (!machine->node.empty()) {
            NodeLink *link = machine->link = NodeLink::ForAddress(machine->node);
            if (!link) {
                error = L"too many nodes of other machines";
                return false;
            }
            if (std::find(remote.begin(), remote.end(), link) == remote.end())
                remote.push_back(link);
        }
    {
        // The new network's nodes are reached before the old ones are let
        // go: a node that both name keeps its connection.
        std::lock_guard<SlimMutex> l(m_useLock);
        if (m_uses > 0) {
            UseRemoteNodes(remote, true);
            UseRemoteNodes(m_remoteNodes, false);
        }
        m_remoteNodes = remote;
        m_hasRemoteNodes = !remote.empty();
    }
    {
        std::lock_guard<SlimMutex> l(m_networkLock);
        // Subscriptions may still hold members of the old network, which
        // point at its machines: it is retired, never destroyed.
        if (m_network)
            m_retired.push_back(std::move(m_network));
        m_network = std::move(network);
        AssignShards();
        m_loadError.clear();
    }
    NotifyTopologyChanged();
    return true;
}

void Engine::AssignShards()
{
    m_network->ForEachMember([this](Machine &machine, MemberPtr &member) {
        member->machine = &machine;
        if (!member->shard)
            member->shard = m_shards[NextShard()].get();
    });
}

double Engine::ElapsedMs(std::chrono::steady_clock::time_point now) const
{
    return std::chrono::duration<double, std::milli>(now - m_epoch).count();
}

void Engine::AddUse()
{
    std::lock_guard<SlimMutex> l(m_useLock);
    if (m_uses++ == 0)
        StartThreads();
}

void Engine::ReleaseUse()
{
    std::lock_guard<SlimMutex> l(m_useLock);
    if (--m_uses == 0)
        StopThreads();
}

void Engine::StartThreads()
{
    for (auto &shard : m_shards)
        shard->Start();
    m_pipe = std::make_unique<ControlPipe>(*this);
    UseRemoteNodes(m_remoteNodes, true);
}

void Engine::StopThreads()
{
    UseRemoteNodes(m_remoteNodes, false);
    m_pipe.reset();
    for (auto &shard : m_shards)
        shard->Stop();
}

void Engine::UseRemoteNodes(const std::vector<NodeLink *> &links, bool use)
{
    for (NodeLink *link : links) {
        if (use) {
            link->AddUse();
            link->AddBrowserReceiver(m_topologyRelay);
        } else {
            link->RemoveBrowserReceiver(m_topologyRelay);
            link->ReleaseUse();
        }
    }
}

NodeLink *Engine::RemoteNodeOf(const std::wstring &url)
{
    if (!m_hasRemoteNodes)
        return nullptr;
    std::wstring name = MachineOf(url);
    if (name.empty() || name == L".")
        return nullptr;
    std::lock_guard<SlimMutex> l(m_networkLock);
    Machine *machine = m_network->FindMachine(name);
    return machine ? machine->link : nullptr; // links live as long as the process
}

bool Engine::HasMember(const std::wstring &url)
{
    if (NodeLink *link = RemoteNodeOf(url))
        return link->Knows(url);
    return FindMember(url) != nullptr;
}

void Engine::Catalogue(std::vector<uint64_t> &out)
{
    std::lock_guard<SlimMutex> l(m_networkLock);
    m_network->Catalogue(out);
}

MemberPtr Engine::FindMember(const std::wstring &url, Machine **machine)
{
    std::lock_guard<SlimMutex> l(m_networkLock);
    auto member = m_network->FindMember(url);
    if (member && machine)
        *machine = member->machine;
    return member;
}

HRESULT Engine::Subscribe(const wchar_t *url, void *cookie, ICadroRealTimeReceiver *receiver, CadroDataItem **out,
                          bool hereOnly, BatchReceiver *batch)
{
    if (!out || !receiver || !url)
        return E_POINTER;
    *out = nullptr;
    NodeLink *link = RemoteNodeOf(url);
    if (link && !hereOnly)
        return link->Subscribe(url, cookie, receiver, out);
    MemberPtr member = link ? nullptr : FindMember(url);
    if (!member) {
        // The network answers at once: contacted, but no such data item.
        for (uint32_t status :
             {kCadroStatusConnecting, kCadroStatusContacted, kCadroStatusSubscribing, kCadroStatusSubscribeFailed})
            receiver->StatusChange(cookie, status, 0, 0);
        return kUnknownUrl;
    }
    auto *sub = new (std::nothrow) Subscription(member, receiver, batch, cookie);
    if (!sub)
        return E_OUTOFMEMORY;
    Shard &shard = *member->shard;
    {
        std::lock_guard<SlimMutex> l(shard.lock);
        Shard::Attach(sub);
        if (member->machine->connected)
            shard.Post(sub, EventKind::Open);
        else
            shard.Post(sub, EventKind::Status, kCadroStatusConnecting);
    }
    ++m_subscriptionCount;
    *out = sub;
    return S_OK;
}

void Engine::Unsubscribe(Subscription *sub)
{
    --m_subscriptionCount;
    Shard &shard = *sub->member->shard;
    std::unique_lock<SlimMutex> l(shard.lock);
    switch (shard.Release(sub, l)) {
    case Shard::Disposal::Now:
        l.unlock();
        delete sub;
        return;
    case Shard::Disposal::AfterQueue: {
        // Nothing calls it any more: its receiver is let go now, only the
        // memory waits for the queue.
        ICadroRealTimeReceiver *receiver = sub->TakeReceiver();
        l.unlock();
        receiver->Release();
        return;
    }
    case Shard::Disposal::AfterUnit:
        return;
    }
}

HRESULT Engine::Write(Subscription *sub, const CadroValue *value)
{
    if (!value)
        return E_POINTER;
    Member &m = *sub->member;
    if (!(m.access & 2))
        return E_ACCESSDENIED;
    if (!m.machine->connected)
        return kNotConnected;
    SimValue converted;
    if (!FromCadroValue(*value, m.type, converted))
        return DISP_E_TYPEMISMATCH;
    Shard &shard = *m.shard;
    std::lock_guard<SlimMutex> l(shard.lock);
    m.value = converted;
    m.hasValue = true;
    m.good = true;
    GetSystemTimeAsFileTime(&m.time);
    // The network echoes the written value to every subscriber.
    for (Subscription *s : m.subscriptions)
        if (s->active)
            shard.Post(s, EventKind::Value);
    return S_OK;
}

HRESULT Engine::Read(Subscription *sub, uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time)
{
    if (!flags || !value || !errorFlag || !time)
        return E_POINTER;
    m_readCount.fetch_add(1, std::memory_order_relaxed);
    *flags = 0;
    *errorFlag = 0;
    *time = {};
    value->type = kCadroCleared;
    value->number = 0;
    Member &m = *sub->member;
    if (!m.machine->connected)
        return kNotConnected;
    std::lock_guard<SlimMutex> l(m.shard->lock);
    if (!m.hasValue || m.removed) {
        GetSystemTimeAsFileTime(time); // no value yet: the time of the query
        return S_OK;
    }
    if (!ToCadroValue(m.value, *value))
        return E_OUTOFMEMORY;
    *flags = kCadroHasValue | kCadroHasQuality | kCadroHasTime;
    *errorFlag = m.good ? 0 : 1;
    *time = m.time;
    return S_OK;
}

bool Engine::List(const std::wstring &url, std::vector<BrowseEntry> &out)
{
    return ListOn(RemoteNodeOf(url), url, out);
}

bool Engine::ListOn(NodeLink *link, const std::wstring &url, std::vector<BrowseEntry> &out)
{
    if (link) {
        // A use of its own: the engine may be idle (a control command).
        link->AddUse();
        bool found = link->Browse(url, out);
        link->ReleaseUse();
        return found;
    }
    std::lock_guard<SlimMutex> l(m_networkLock);
    return m_network->List(url, out);
}

bool Engine::Browse(const std::wstring &url, std::vector<BrowseEntry> &out, bool hereOnly)
{
    ++m_browseCount;
    NodeLink *link = RemoteNodeOf(url);
    if (hereOnly && link) {
        out.clear();
        return false;
    }
    return ListOn(link, url, out);
}

void Engine::SetShutdownHandler(std::function<void()> handler)
{
    std::lock_guard<SlimMutex> l(m_shutdownLock);
    m_shutdown = std::move(handler);
}

void Engine::AddBrowserReceiver(ICadroBrowserReceiver *receiver)
{
    std::lock_guard<SlimMutex> l(m_receiversLock);
    receiver->AddRef();
    m_browserReceivers.push_back(receiver);
}

void Engine::RemoveBrowserReceiver(ICadroBrowserReceiver *receiver)
{
    std::lock_guard<SlimMutex> l(m_receiversLock);
    auto it = std::find(m_browserReceivers.begin(), m_browserReceivers.end(), receiver);
    if (it != m_browserReceivers.end()) {
        m_browserReceivers.erase(it);
        receiver->Release();
    }
}

void Engine::NotifyTopologyChanged()
{
    std::vector<ICadroBrowserReceiver *> receivers;
    {
        std::lock_guard<SlimMutex> l(m_receiversLock);
        receivers = m_browserReceivers;
        for (auto *r : receivers)
            r->AddRef();
    }
    for (auto *r : receivers) {
        r->BrowseItemChanged();
        r->Release();
    }
}

} // namespace cadrosim

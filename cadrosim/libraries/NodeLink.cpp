// A node link's life: made once per node, its thread, its connection (a
// node started when none runs) and its losses.
#include "NodeLinkParts.h"

#include "PipeChannel.h"
#include "RingChannel.h"
#include "SocketChannel.h"
#include "ThreadName.h"

#include <utility>

namespace cadrosim {
using namespace link; // the link's own limits and waits

namespace {
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
    m_thread = NamedThread(L"node link", [this, generation] { Run(generation); });
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

std::shared_ptr<Channel> NodeLink::Connect(bool mayStart, unsigned generation)
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
            return RingChannel::AskForRings(std::make_shared<PipeChannel>(pipe), kStartWaitMs);
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
                m_subs.ForEach([&](RemoteSubscription *sub) {
                    Send(wire::Kind::Subscribe, [&](wire::Out &out) {
                        out.U32(0);
                        out.U32(sub->id);
                        out.Text(sub->Url());
                    });
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
    bool fine = true;
    while (fine && channel.Read(buffer)) {
        fine = wire::TakeFrames(buffer, [&](wire::Kind kind, wire::In in) { Dispatch(kind, in); });
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
        m_known.Forget();
        for (auto &entry : m_pending)
            entry.second->Finish(); // unanswered
        m_pending.clear();
        DropFeeds(); // the node's feeds are the connection's
        // Told once, however often a connection fails before the node is
        // back.
        m_subs.ForEach([&](RemoteSubscription *sub) {
            if (sub->Connected())
                ids.push_back(sub->id);
        });
    }
    m_changed.notify_all();
    for (uint32_t id : ids)
        CallSubscription(
            id,
            [](RemoteSubscription &sub) { sub.Receiver()->StatusChange(sub.cookie, kCadroStatusDisconnected, 0, 0); },
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

} // namespace cadrosim

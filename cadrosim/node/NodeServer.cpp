#include "NodeServer.h"

#include "PipeChannel.h"
#include "Wire.h"

#include <cstdio>
#include <new>

namespace cadrosim {

namespace {
constexpr DWORD kPipeBuffer = 1 << 20;
constexpr DWORD kIdleCheckMs = 500;
} // namespace

NodeServer *NodeServer::Create(Engine &engine, DWORD idleMs, std::wstring name, std::wstring listen)
{
    return new (std::nothrow) NodeServer(engine, idleMs, std::move(name), std::move(listen));
}

NodeServer::NodeServer(Engine &engine, DWORD idleMs, std::wstring name, std::wstring listen)
    : m_engine(engine), m_idleMs(idleMs), m_pipeName(wire::PipeNameOf(name)), m_listen(std::move(listen)),
      m_stop(CreateEventW(nullptr, TRUE, FALSE, nullptr)), m_sessionEnded(CreateEventW(nullptr, FALSE, FALSE, nullptr))
{
}

NodeServer::~NodeServer()
{
    CloseHandle(m_stop);
    CloseHandle(m_sessionEnded);
}

HANDLE NodeServer::NewInstance(bool first)
{
    return CreateNamedPipeW(m_pipeName.c_str(),
                            PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED | (first ? FILE_FLAG_FIRST_PIPE_INSTANCE : 0),
                            PIPE_TYPE_BYTE | PIPE_READMODE_BYTE | PIPE_WAIT, PIPE_UNLIMITED_INSTANCES, kPipeBuffer,
                            kPipeBuffer, 0, nullptr);
}

int NodeServer::Run()
{
    // One node per machine: libraries that find none may start several at
    // once. The name is held for the node's life (the pipe's own "first
    // instance" flag is not honoured everywhere).
    std::wstring mutexName = L"Local\\" + m_pipeName.substr(m_pipeName.rfind(L'\\') + 1);
    HANDLE single = CreateMutexW(nullptr, FALSE, mutexName.c_str());
    if (!single || GetLastError() == ERROR_ALREADY_EXISTS) {
        if (single)
            CloseHandle(single);
        return 1;
    }
    std::wstring why;
    if (!m_listen.empty() && !m_listener.Open(m_listen, why)) {
        fwprintf(stderr, L"cadronode: %ls\n", why.c_str());
        CloseHandle(single);
        return 3;
    }
    // The network is up before the pipe appears: a library that finds the
    // pipe finds a node ready to answer.
    m_engine.AddUse();
    HANDLE pipe = NewInstance(true);
    if (pipe == INVALID_HANDLE_VALUE) {
        m_engine.ReleaseUse();
        CloseHandle(single);
        return 1;
    }
    m_engine.AddBrowserReceiver(this);
    m_engine.SetShutdownHandler([this] { Stop(); });
    HANDLE connected = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    DWORD idleSince = GetTickCount();
    bool listening = false;
    bool connectedBefore = false; // the library came before the wait for it
    OVERLAPPED ov = {};
    for (;;) {
        if (pipe == INVALID_HANDLE_VALUE)
            pipe = NewInstance(false); // the last attempt failed: again
        if (!listening && pipe != INVALID_HANDLE_VALUE) {
            ov = {};
            ov.hEvent = connected;
            ResetEvent(connected);
            listening = !ConnectNamedPipe(pipe, &ov) && GetLastError() == ERROR_IO_PENDING;
            DWORD error = GetLastError();
            if (!listening && error == ERROR_PIPE_CONNECTED) {
                // Nothing is pending on ov then: its result would be this
                // "error", and the library would lose its connection.
                listening = true;
                connectedBefore = true;
                SetEvent(connected);
            } else if (!listening) {
                // A client that came and went before the wait (no data), or
                // a broken instance: it would refuse every later client too.
                DisconnectNamedPipe(pipe);
                CloseHandle(pipe);
                pipe = NewInstance(false);
                continue;
            }
        }
        HANDLE events[] = {m_stop, connected, m_sessionEnded, m_listener.Event()};
        DWORD woke = WaitForMultipleObjects(m_listener.Event() ? 4 : 3, events, FALSE, kIdleCheckMs);
        if (woke == WAIT_OBJECT_0)
            break;
        if (woke == WAIT_OBJECT_0 + 3)
            if (std::unique_ptr<SocketChannel> channel = m_listener.Accept())
                AddSession(std::move(channel), true);
        if (woke == WAIT_OBJECT_0 + 1) {
            DWORD unused = 0;
            listening = false;
            bool accepted = connectedBefore || GetOverlappedResult(pipe, &ov, &unused, FALSE);
            connectedBefore = false;
            if (accepted)
                AddSession(std::make_shared<PipeChannel>(pipe), false);
            else
                CloseHandle(pipe);
            pipe = NewInstance(false);
        }
        Reap(false);
        bool idle;
        {
            std::lock_guard<SlimMutex> l(m_sessionsLock);
            idle = m_sessions.empty();
        }
        if (!idle)
            idleSince = GetTickCount();
        else if (GetTickCount() - idleSince >= m_idleMs)
            break;
    }
    m_engine.SetShutdownHandler(nullptr);
    if (listening && !connectedBefore) {
        CancelIoEx(pipe, &ov);
        DWORD unused = 0;
        GetOverlappedResult(pipe, &ov, &unused, TRUE);
    }
    if (pipe != INVALID_HANDLE_VALUE)
        CloseHandle(pipe);
    CloseHandle(connected);
    Reap(true);
    m_engine.RemoveBrowserReceiver(this);
    m_engine.ReleaseUse();
    CloseHandle(single);
    return 0;
}

void NodeServer::AddSession(std::shared_ptr<Channel> channel, bool fromNode)
{
    std::lock_guard<SlimMutex> l(m_sessionsLock);
    if (NodeSession *session = NodeSession::Start(m_engine, std::move(channel), fromNode, m_sessionEnded))
        m_sessions.push_back(session);
}

void NodeServer::Reap(bool all)
{
    std::vector<NodeSession *> done;
    {
        std::lock_guard<SlimMutex> l(m_sessionsLock);
        for (auto it = m_sessions.begin(); it != m_sessions.end();) {
            if (all)
                (*it)->Finish();
            if (all || (*it)->Ended()) {
                done.push_back(*it);
                it = m_sessions.erase(it);
            } else {
                ++it;
            }
        }
    }
    // A library that does not take the closing word within a few seconds
    // (a busy one may have a backlog to read first) is not waited for.
    for (DWORD waited = 0; all && waited < 10000; waited += 20) {
        bool ended = true;
        for (NodeSession *session : done)
            ended = ended && session->Ended();
        if (ended)
            break;
        Sleep(20);
    }
    for (NodeSession *session : done) {
        session->Close();
        session->Join();
        session->Release(); // the engine's subscriptions may hold it a little longer
    }
}

HRESULT STDMETHODCALLTYPE NodeServer::BrowseItemChanged()
{
    std::lock_guard<SlimMutex> l(m_sessionsLock);
    for (NodeSession *session : m_sessions)
        session->TopologyChanged();
    return S_OK;
}

} // namespace cadrosim

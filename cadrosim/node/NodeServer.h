#pragma once
// The network node: the engine of this process served to the libraries of
// server processes over the node pipe, and to the nodes of other machines
// over TCP when given a port. It runs until "shutdown" or until nothing has
// been connected for the idle time.
#include "Engine.h"
#include "NodeSession.h"
#include "TcpListener.h"

#include <string>
#include <vector>

namespace cadrosim {

class NodeServer : public CSimUnknown<ICadroBrowserReceiver> {
public:
    // name: of the node's pipe (a second node on one machine needs its own);
    // listen: "[host:]port" for other nodes, or empty.
    static NodeServer *Create(Engine &engine, DWORD idleMs, std::wstring name, std::wstring listen);
    // 0 after a shutdown or the idle time; 1 when another node serves the
    // pipe already or it cannot be made; 3 when the port cannot be opened.
    int Run();
    void Stop() { SetEvent(m_stop); }

    HRESULT STDMETHODCALLTYPE BrowseItemChanged() override;

private:
    NodeServer(Engine &engine, DWORD idleMs, std::wstring name, std::wstring listen);
    ~NodeServer() override;
    HANDLE NewInstance(bool first);
    void AddSession(std::shared_ptr<Channel> channel, bool fromNode);
    void Reap(bool all);

    Engine &m_engine;
    DWORD m_idleMs;
    std::wstring m_pipeName;
    std::wstring m_listen;
    TcpListener m_listener;
    HANDLE m_stop;
    HANDLE m_sessionEnded;
    SlimMutex m_sessionsLock;
    std::vector<NodeSession *> m_sessions;
};

} // namespace cadrosim

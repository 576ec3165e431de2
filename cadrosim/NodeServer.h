#pragma once
// The network node: the engine of this process served to the libraries of
// server processes over the node pipe. It runs until "shutdown" or until no
// library has been connected for the idle time.
#include "Engine.h"
#include "NodeSession.h"

#include <vector>

namespace cadrosim {

class NodeServer : public CSimUnknown<ICadroBrowserReceiver> {
public:
    static NodeServer *Create(Engine &engine, DWORD idleMs);
    // 0 after a shutdown or the idle time; 1 when another node serves the
    // pipe already or it cannot be made.
    int Run();
    void Stop() { SetEvent(m_stop); }

    HRESULT STDMETHODCALLTYPE BrowseItemChanged() override;

private:
    NodeServer(Engine &engine, DWORD idleMs);
    ~NodeServer() override;
    HANDLE NewInstance(bool first);
    void Reap(bool all);

    Engine &m_engine;
    DWORD m_idleMs;
    HANDLE m_stop;
    HANDLE m_sessionEnded;
    SlimMutex m_sessionsLock;
    std::vector<NodeSession *> m_sessions;
};

} // namespace cadrosim

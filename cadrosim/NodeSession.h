#pragma once
// One server process's connection to the network node: its subscriptions on
// the node's engine, the requests it sends and the callbacks it is sent,
// gathered into batches (whatever came while the last batch was written goes
// out in one write).
#include "Engine.h"
#include "FrameQueue.h"

#include <thread>
#include <unordered_map>

namespace cadrosim {

class NodeSession : public CSimUnknown<ICadroRealTimeReceiver> {
public:
    // Starts serving a connected library, or the node of another machine
    // (fromNode: it is served only the machines this node serves itself);
    // ended is signalled when it is done.
    static NodeSession *Start(Engine &engine, std::shared_ptr<Channel> channel, bool fromNode, HANDLE ended);
    // Tells the library that the node is closing, then ends the connection
    // (the session then lets go of its subscriptions).
    void Finish();
    // Ends the connection at once.
    void Close() { m_channel->Close(); }
    bool Ended() const { return m_ended; }
    // Waits for its threads; after Ended().
    void Join();
    // Tells the library that the topology changed.
    void TopologyChanged();

    HRESULT STDMETHODCALLTYPE OnData(void *cookie, uint32_t flags, const CadroValue *value, int32_t errorFlag,
                                     uint32_t timeLow, uint32_t timeHigh) override;
    HRESULT STDMETHODCALLTYPE OnAttributes(void *cookie, const CadroAttributes *attributes) override;
    HRESULT STDMETHODCALLTYPE StatusChange(void *cookie, uint32_t status, uint32_t, uint32_t) override;

private:
    NodeSession(Engine &engine, std::shared_ptr<Channel> channel, bool fromNode, HANDLE ended);
    void ReadLoop();
    bool Handle(wire::Kind kind, wire::In &in);
    void Subscribe(wire::In &in);
    void Unsubscribe(uint32_t id);
    void List(uint32_t request, const std::wstring &url);
    CadroDataItem *Find(uint32_t id);
    // A reply: written by the reading thread itself, at once.
    template <class Fill> void Reply(Fill fill);
    void ReleaseAll();

    Engine &m_engine;
    std::shared_ptr<Channel> m_channel;
    bool m_fromNode;
    HANDLE m_endedEvent;
    std::atomic<bool> m_ended{false};
    SlimMutex m_subsLock;
    std::unordered_map<uint32_t, CadroDataItem *> m_subs;
    FrameQueue m_queue;
    std::thread m_reader;
};

} // namespace cadrosim

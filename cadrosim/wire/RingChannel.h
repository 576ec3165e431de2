#pragma once
// A byte stream between a library and its node through memory that both
// processes map: one ring each way, and events that wake a side only when
// it sleeps. Under Wine every byte written into a pipe passes through the
// Wine server twice; here it is copied once, into the ring, and read once.
//
// The rings are set up over the node's pipe (the library asks, the node
// makes them and answers with their name), and the pipe stays open beside
// them as the connection's life: a peer that dies breaks it, and a read kept
// pending on it wakes every wait. Neither side trusts what the other writes
// into the shared memory: positions that make no sense end the connection.
#include "PipeChannel.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

namespace cadrosim {

class RingChannel : public Channel {
public:
    // The node's side: the rings for a library connected by pipe, and
    // their name for it; null when they cannot be made.
    static std::unique_ptr<RingChannel> Make(std::shared_ptr<PipeChannel> pipe, std::wstring &name);
    // The library's side: the rings a node made; null when they cannot be
    // opened or are not what a node makes.
    static std::unique_ptr<RingChannel> Open(std::shared_ptr<PipeChannel> pipe, const std::wstring &name);
    // The library's side of setting them up: asks the node over its pipe.
    // The rings, or the pipe itself when the node keeps to it; null when
    // the node did not answer within timeoutMs or its rings cannot be opened.
    static std::shared_ptr<Channel> AskForRings(std::shared_ptr<PipeChannel> pipe, DWORD timeoutMs);
    ~RingChannel() override;
    RingChannel(const RingChannel &) = delete;
    RingChannel &operator=(const RingChannel &) = delete;

    bool Read(std::string &buffer) override;
    bool Write(const std::string &bytes) override;
    // Ends both directions for both sides; what was written before reaches
    // the peer first.
    void Close() override;

    static constexpr uint32_t kRingBytes = 1u << 20;

    // The shared memory: a header page, then the node's ring (which the
    // library reads), then the library's.
    struct Ring {
        alignas(64) std::atomic<uint64_t> written; // bytes ever written, by the writer
        std::atomic<uint32_t> readerSleeps;
        alignas(64) std::atomic<uint64_t> taken; // bytes ever read, by the reader
        std::atomic<uint32_t> writerSleeps;
    };
    struct Header {
        uint32_t magic;
        uint32_t ringBytes;
        std::atomic<uint32_t> closed[2]; // by side: 0 the node, 1 the library
        Ring rings[2];                   // by writer's side
    };
    static constexpr size_t kHeaderBytes = 4096;
    static constexpr uint32_t kMagic = 0x676e6952; // "Ring"

private:
    // The mapping, its view and the four events (data and room of ring 0,
    // then of ring 1), given back when it goes.
    struct Shared {
        HANDLE mapping = nullptr;
        void *view = nullptr;
        HANDLE events[4] = {};
        ~Shared();
    };
    RingChannel(std::shared_ptr<PipeChannel> pipe, int side, std::unique_ptr<Shared> shared);
    // The channel of a side over shared memory that is all there; null
    // when memory is short.
    static std::unique_ptr<RingChannel> Build(std::shared_ptr<PipeChannel> pipe, int side,
                                              std::unique_ptr<Shared> shared);
    static std::wstring EventName(const std::wstring &name, int ring, bool room);
    // Starts the read on the pipe that ends when the peer goes.
    void WatchPipe();
    // Sleeps until woken through event, the connection ends, or a while
    // passes.
    void Sleep(HANDLE event);
    // The bytes from behind to ahead, two positions of a ring; false (and
    // the channel closed) when they claim more than a ring holds, which no
    // side of ours ever writes.
    bool Span(uint64_t ahead, uint64_t behind, uint64_t &bytes);
    // Closed here, or by the peer, or the peer gone.
    bool Ended() const;

    std::shared_ptr<PipeChannel> m_pipe;
    const int m_side;
    std::unique_ptr<Shared> m_shared;
    Header *m_header;
    Ring &m_in, &m_out;
    const char *m_inBytes;
    char *m_outBytes;
    // m_shared's events: the data event of the ring read and the room
    // event of the ring written, which this side waits for; the other two
    // it sets.
    HANDLE m_inData, m_inRoom, m_outData, m_outRoom;
    HANDLE m_broken; // the pipe's read ended: the peer went, or Close()
    OVERLAPPED m_watch = {};
    char m_watchByte = 0;
    bool m_watching = false;
    std::atomic<bool> m_peerGone{false};
    // This side's own positions: the shared ones are only ever written
    // from them, never read back.
    uint64_t m_taken = 0;
    uint64_t m_written = 0;
    std::atomic<bool> m_closed{false};
};

} // namespace cadrosim

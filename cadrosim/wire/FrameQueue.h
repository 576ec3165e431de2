#pragma once
// Frames on their way into a pipe. Frames that nobody waits for are written
// by the queue's own thread, in batches of whatever gathered during the
// previous write, and never sooner than kGatherTime after it; a thread that
// waits for an answer writes its request itself (Flush), which spares the
// hand-over to the writing thread and the wait.
#include "Channel.h"
#include "SlimSync.h"
#include "Wire.h"

#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>

namespace cadrosim {

class FrameQueue {
public:
    // A queue that holds more than limit bytes closes its pipe: the reader
    // at the other end is hung.
    explicit FrameQueue(size_t limit = SIZE_MAX) : m_limit(limit) {}
    ~FrameQueue() { Stop(false); }
    FrameQueue(const FrameQueue &) = delete;
    FrameQueue &operator=(const FrameQueue &) = delete;

    // Starts writing into channel (frames queued before are dropped).
    void Attach(std::shared_ptr<Channel> channel);
    // Stops writing and drops what is queued.
    void Detach();
    // Ends the writing thread; with drain, what is queued is written first.
    void Stop(bool drain);

    // Queues one frame; false (and nothing queued) without a pipe.
    template <class Fill> bool Push(wire::Kind kind, Fill fill)
    {
        std::lock_guard<SlimMutex> l(m_lock);
        if (!m_channel)
            return false;
        bool wake = m_out.Empty();
        m_out.Begin(kind);
        fill(m_out);
        m_out.End();
        return Queued(wake);
    }
    // Queues id under fields as a frame of kind, one of ids that share
    // them: added to the last frame queued when that has the same fields (a
    // value delivered to many subscriptions travels once).
    bool PushId(wire::Kind kind, std::string_view fields, uint32_t id);
    // PushId for many under one hold of the lock: fill(push) calls
    // push(kind, fields, id) for each.
    template <class Fill> bool PushIds(Fill fill)
    {
        std::lock_guard<SlimMutex> l(m_lock);
        if (!m_channel)
            return false;
        bool wake = m_out.Empty();
        fill([this](wire::Kind kind, std::string_view fields, uint32_t id) { Add(kind, fields, id); });
        return Queued(wake && !m_out.Empty());
    }
    // Writes what is queued from this thread, unless a write is under way
    // (which then takes it along).
    void Flush();
    // Closes the pipe once everything queued has been written.
    void CloseWhenWritten();
    // Bytes queued and not yet being written.
    size_t Backlog();
    // Called by the writing thread, without the lock, whenever it has
    // written everything queued (set before Attach).
    void SetDrainedHandler(std::function<void()> handler) { m_drained = std::move(handler); }

private:
    // Under the lock, after a frame was added: wakes the writer, or closes a
    // pipe whose reader has fallen too far behind.
    bool Queued(bool wake);
    // Under the lock: PushId's frame or id.
    void Add(wire::Kind kind, std::string_view fields, uint32_t id);
    // After a drain, under l (let go for the call): the drained handler,
    // when the queue is empty.
    void DrainedWith(std::unique_lock<SlimMutex> &l);
    void WriteLoop();
    // Under l: writes batches until the queue is empty; m_writing is ours.
    void Drain(std::unique_lock<SlimMutex> &l);

    static constexpr size_t kKeptBatchBytes = 1u << 20;
    // A burst of frames (a client adding 10,000 items makes a subscription
    // every few microseconds) was written a few frames at a time, each
    // write waking the other side, which under Wine is a request to the
    // Wine server on both sides: some 1,500 writes for 10,000 subscriptions,
    // and AddItems took 30-100 ms in process instead of 18-52. A frame after
    // a quiet spell still goes at once; in a burst, frames wait at most this
    // long for the ones behind them.
    static constexpr std::chrono::milliseconds kGatherTime{1};

    size_t m_limit;
    SlimMutex m_lock;
    SlimCondition m_ready;
    SlimCondition m_idle;
    wire::Out m_out;
    std::string m_batch; // being written
    std::function<void()> m_drained;
    std::shared_ptr<Channel> m_channel;
    bool m_writing = false;
    bool m_stopping = false;
    bool m_closeWhenWritten = false;
    std::thread m_thread;
    std::chrono::steady_clock::time_point m_lastWrite{}; // by the writing thread
};

} // namespace cadrosim

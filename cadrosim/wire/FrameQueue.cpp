#include "FrameQueue.h"

#include "ThreadName.h"

namespace cadrosim {

void FrameQueue::Attach(std::shared_ptr<Channel> channel)
{
    std::lock_guard<SlimMutex> l(m_lock);
    m_out.Clear();
    m_channel = std::move(channel);
    m_stopping = false;
    m_closeWhenWritten = false;
    if (!m_thread.joinable())
        m_thread = NamedThread(L"frame writer", [this] { WriteLoop(); });
}

bool FrameQueue::Queued(bool wake)
{
    if (m_out.Size() > m_limit) {
        m_channel->Close();
        m_out.Clear();
        return false;
    }
    if (wake)
        m_ready.notify_one();
    return true;
}

bool FrameQueue::PushId(wire::Kind kind, std::string_view fields, uint32_t id)
{
    std::lock_guard<SlimMutex> l(m_lock);
    if (!m_channel)
        return false;
    bool wake = m_out.Empty();
    Add(kind, fields, id);
    return Queued(wake);
}

void FrameQueue::Add(wire::Kind kind, std::string_view fields, uint32_t id)
{
    if (!m_out.ExtendLast(kind, fields, id))
        m_out.Frame(kind, fields, id);
}

void FrameQueue::Detach()
{
    std::lock_guard<SlimMutex> l(m_lock);
    m_channel.reset();
    m_out.Clear();
}

void FrameQueue::Stop(bool drain)
{
    std::thread thread;
    {
        std::unique_lock<SlimMutex> l(m_lock);
        if (!drain)
            m_out.Clear();
        m_stopping = true;
        thread = std::move(m_thread);
    }
    m_ready.notify_all();
    if (thread.joinable())
        thread.join();
}

void FrameQueue::Flush()
{
    std::unique_lock<SlimMutex> l(m_lock);
    if (m_writing)
        return;
    m_writing = true;
    Drain(l);
    DrainedWith(l);
}

void FrameQueue::DrainedWith(std::unique_lock<SlimMutex> &l)
{
    // Whichever thread wrote the last of the queue tells the handler: what
    // waits for the queue to be written (values held back) would otherwise
    // wait for the next frame.
    if (m_drained && m_out.Empty() && !m_stopping) {
        l.unlock();
        m_drained();
        l.lock();
    }
}

void FrameQueue::Drain(std::unique_lock<SlimMutex> &l)
{
    // Only one drain runs at a time (m_writing): the batch's buffer is kept
    // from one to the next, and goes back to the queue at each exchange.
    std::string &batch = m_batch;
    while (!m_out.Empty() && m_channel) {
        std::shared_ptr<Channel> channel = m_channel;
        m_out.Take(batch);
        l.unlock();
        if (!channel->Write(batch))
            channel->Close(); // the reading side sees it and ends the connection
        batch.clear();
        // A burst (the first frames of 100,000 subscriptions) leaves both
        // buffers as large as itself; kept, they would cost as much as the
        // subscriptions. Steady batches stay well below the bound.
        if (batch.capacity() > kKeptBatchBytes)
            std::string().swap(batch);
        l.lock();
    }
    m_writing = false;
    if (m_closeWhenWritten && m_channel)
        m_channel->Close();
    m_idle.notify_all();
}

void FrameQueue::CloseWhenWritten()
{
    // Never writes from this thread: the other end may not be reading.
    std::lock_guard<SlimMutex> l(m_lock);
    m_closeWhenWritten = true;
    if (m_channel && m_out.Empty() && !m_writing)
        m_channel->Close();
}

void FrameQueue::WriteLoop()
{
    std::unique_lock<SlimMutex> l(m_lock);
    for (;;) {
        m_ready.wait(l, [this] { return m_stopping || (!m_out.Empty() && m_channel && !m_writing); });
        if (m_stopping) {
            // What is left is written unless a flush is writing it already.
            m_idle.wait(l, [this] { return !m_writing; });
            m_writing = true;
            Drain(l);
            return;
        }
        const auto gather = m_lastWrite + kGatherTime;
        while (!m_stopping && std::chrono::steady_clock::now() < gather)
            m_ready.wait_until(l, gather);
        if (m_stopping || m_writing || !m_channel || m_out.Empty())
            continue; // stopping, or a flush took the frames meanwhile
        m_writing = true;
        Drain(l);
        m_lastWrite = std::chrono::steady_clock::now();
        DrainedWith(l);
    }
}

size_t FrameQueue::Backlog()
{
    std::lock_guard<SlimMutex> l(m_lock);
    return m_out.Size();
}

} // namespace cadrosim

#include "RingChannel.h"

#include "Wire.h"

#include <algorithm>
#include <cstring>

namespace cadrosim {

namespace {
constexpr size_t kMappingBytes = RingChannel::kHeaderBytes + 2 * size_t{RingChannel::kRingBytes};
// A wait wakes now and then to look again: a peer that writes garbage into
// the shared flags could otherwise keep a side asleep.
constexpr DWORD kLookAgainMs = 200;
} // namespace

std::wstring RingChannel::EventName(const std::wstring &name, int ring, bool room)
{
    return name + (room ? L"-room" : L"-data") + std::to_wstring(ring);
}

RingChannel::Shared::~Shared()
{
    for (HANDLE event : events)
        if (event)
            CloseHandle(event);
    if (view)
        UnmapViewOfFile(view);
    if (mapping)
        CloseHandle(mapping);
}

std::unique_ptr<RingChannel> RingChannel::Build(std::shared_ptr<PipeChannel> pipe, int side,
                                                std::unique_ptr<Shared> shared)
{
    return std::unique_ptr<RingChannel>(new (std::nothrow) RingChannel(std::move(pipe), side, std::move(shared)));
}

std::unique_ptr<RingChannel> RingChannel::Make(std::shared_ptr<PipeChannel> pipe, std::wstring &name)
{
    static std::atomic<unsigned> made{0};
    // A name that exists already (left by no one of ours, since each is
    // the node's process id and a count) is passed over, not shared.
    for (int attempt = 0; attempt < 4; ++attempt) {
        name = L"Local\\CadroSim-rings-" + std::to_wstring(GetCurrentProcessId()) + L"-" + std::to_wstring(made++);
        std::unique_ptr<Shared> shared(new (std::nothrow) Shared);
        if (!shared)
            return nullptr;
        shared->mapping = CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0,
                                             static_cast<DWORD>(kMappingBytes), name.c_str());
        if (!shared->mapping)
            return nullptr;
        bool fresh = GetLastError() != ERROR_ALREADY_EXISTS;
        for (int i = 0; i < 4 && fresh; ++i) {
            shared->events[i] = CreateEventW(nullptr, FALSE, FALSE, EventName(name, i / 2, i % 2).c_str());
            if (!shared->events[i])
                return nullptr;
            fresh = GetLastError() != ERROR_ALREADY_EXISTS;
        }
        if (!fresh)
            continue;
        shared->view = MapViewOfFile(shared->mapping, FILE_MAP_ALL_ACCESS, 0, 0, kMappingBytes);
        if (!shared->view)
            return nullptr;
        auto *header = static_cast<Header *>(shared->view);
        header->magic = kMagic;
        header->ringBytes = kRingBytes;
        return Build(std::move(pipe), 0, std::move(shared));
    }
    return nullptr;
}

std::unique_ptr<RingChannel> RingChannel::Open(std::shared_ptr<PipeChannel> pipe, const std::wstring &name)
{
    std::unique_ptr<Shared> shared(new (std::nothrow) Shared);
    if (!shared)
        return nullptr;
    shared->mapping = OpenFileMappingW(FILE_MAP_ALL_ACCESS, FALSE, name.c_str());
    shared->view = shared->mapping ? MapViewOfFile(shared->mapping, FILE_MAP_ALL_ACCESS, 0, 0, 0) : nullptr;
    MEMORY_BASIC_INFORMATION info = {};
    auto *header = static_cast<Header *>(shared->view);
    if (!header || VirtualQuery(header, &info, sizeof info) != sizeof info || info.RegionSize < kMappingBytes ||
        header->magic != kMagic || header->ringBytes != kRingBytes)
        return nullptr;
    for (int i = 0; i < 4; ++i) {
        shared->events[i] = OpenEventW(EVENT_MODIFY_STATE | SYNCHRONIZE, FALSE, EventName(name, i / 2, i % 2).c_str());
        if (!shared->events[i])
            return nullptr;
    }
    return Build(std::move(pipe), 1, std::move(shared));
}

std::shared_ptr<Channel> RingChannel::AskForRings(std::shared_ptr<PipeChannel> pipe, DWORD timeoutMs)
{
    wire::Out out;
    out.Begin(wire::Kind::UseRings);
    out.End();
    std::string question;
    out.Take(question);
    if (!pipe->Write(question))
        return nullptr;
    std::string buffer;
    bool answered = false, fine = true;
    std::wstring name;
    const DWORD begin = GetTickCount();
    while (fine && !answered) {
        DWORD spent = GetTickCount() - begin;
        if (spent >= timeoutMs || !pipe->Read(buffer, timeoutMs - spent))
            return nullptr;
        bool framed = wire::TakeFrames(buffer, [&](wire::Kind kind, wire::In in) {
            fine = fine && !answered && kind == wire::Kind::Rings;
            answered = true;
            name = in.Text();
            fine = fine && in.Ok();
        });
        fine = fine && framed;
    }
    // The answer is the pipe's last frame: the rest comes through the rings.
    if (!fine || !buffer.empty())
        return nullptr;
    if (name.empty())
        return pipe;
    return Open(std::move(pipe), name);
}

RingChannel::RingChannel(std::shared_ptr<PipeChannel> pipe, int side, std::unique_ptr<Shared> shared)
    : m_pipe(std::move(pipe)), m_side(side), m_shared(std::move(shared)),
      m_header(static_cast<Header *>(m_shared->view)), m_in(m_header->rings[1 - side]), m_out(m_header->rings[side]),
      m_inBytes(static_cast<const char *>(m_shared->view) + kHeaderBytes + size_t{kRingBytes} * (1 - side)),
      m_outBytes(static_cast<char *>(m_shared->view) + kHeaderBytes + size_t{kRingBytes} * side),
      m_inData(m_shared->events[2 * (1 - side)]), m_inRoom(m_shared->events[2 * (1 - side) + 1]),
      m_outData(m_shared->events[2 * side]), m_outRoom(m_shared->events[2 * side + 1]),
      m_broken(CreateEventW(nullptr, TRUE, FALSE, nullptr))
{
    // The rings are the connection's, whatever it carries: their pages are
    // brought in now (read, since the peer may be writing already), not
    // by the first burst that runs through them.
    const volatile char *bytes = static_cast<const volatile char *>(m_shared->view);
    for (size_t at = 0; at < kMappingBytes; at += 4096)
        (void)bytes[at];
    WatchPipe();
}

RingChannel::~RingChannel()
{
    Close();
    // The read on the pipe writes into this object until it has ended.
    if (m_watching) {
        DWORD unused = 0;
        GetOverlappedResult(m_pipe->Handle(), &m_watch, &unused, TRUE);
    }
    if (m_broken)
        CloseHandle(m_broken);
}

void RingChannel::WatchPipe()
{
    m_watch.hEvent = m_broken;
    if (!m_broken) {
        m_peerGone = true;
        return;
    }
    // Nothing more is to come through the pipe: a read that ends, with
    // bytes or without, ends the connection.
    if (!ReadFile(m_pipe->Handle(), &m_watchByte, 1, nullptr, &m_watch) && GetLastError() == ERROR_IO_PENDING)
        m_watching = true;
    else
        m_peerGone = true;
}

bool RingChannel::Ended() const
{
    return m_closed.load(std::memory_order_relaxed) || m_pipe->Closed() || m_peerGone.load(std::memory_order_relaxed) ||
           m_header->closed[1 - m_side].load(std::memory_order_acquire) != 0;
}

void RingChannel::Sleep(HANDLE event)
{
    HANDLE handles[] = {event, m_broken};
    if (WaitForMultipleObjects(2, handles, FALSE, kLookAgainMs) == WAIT_OBJECT_0 + 1)
        m_peerGone = true;
}

bool RingChannel::Span(uint64_t ahead, uint64_t behind, uint64_t &bytes)
{
    bytes = ahead - behind;
    if (bytes <= kRingBytes)
        return true;
    Close();
    return false;
}

bool RingChannel::Read(std::string &buffer)
{
    for (;;) {
        if (m_closed.load(std::memory_order_relaxed) || m_pipe->Closed())
            return false;
        uint64_t written = m_in.written.load(std::memory_order_acquire);
        uint64_t ready;
        if (!Span(written, m_taken, ready))
            return false;
        if (ready) {
            // A read takes at most what a pipe's would: a burst (100,000
            // subscriptions) would otherwise grow the reader's buffer to
            // the whole ring, and keep it.
            ready = std::min<uint64_t>(ready, kReadChunk);
            written = m_taken + ready;
            size_t at = static_cast<size_t>(m_taken % kRingBytes);
            size_t first = std::min<size_t>(ready, kRingBytes - at);
            buffer.append(m_inBytes + at, first);
            buffer.append(m_inBytes, ready - first);
            m_taken = written;
            m_in.taken.store(m_taken);
            if (m_in.writerSleeps.load())
                SetEvent(m_inRoom);
            return true;
        }
        // What the peer wrote before it went is read first.
        if (Ended())
            return false;
        m_in.readerSleeps.store(1);
        if (m_in.written.load() == written)
            Sleep(m_inData);
        m_in.readerSleeps.store(0, std::memory_order_relaxed);
    }
}

bool RingChannel::Write(const std::string &bytes)
{
    size_t done = 0;
    while (done < bytes.size()) {
        if (Ended())
            return false;
        uint64_t taken = m_out.taken.load(std::memory_order_acquire);
        uint64_t used;
        if (!Span(m_written, taken, used))
            return false;
        size_t room = static_cast<size_t>(kRingBytes - used);
        if (room) {
            size_t n = std::min(room, bytes.size() - done);
            size_t at = static_cast<size_t>(m_written % kRingBytes);
            size_t first = std::min(n, kRingBytes - at);
            memcpy(m_outBytes + at, bytes.data() + done, first);
            memcpy(m_outBytes, bytes.data() + done + first, n - first);
            m_written += n;
            done += n;
            m_out.written.store(m_written);
            if (m_out.readerSleeps.load())
                SetEvent(m_outData);
            continue;
        }
        m_out.writerSleeps.store(1);
        if (m_out.taken.load() == taken)
            Sleep(m_outRoom);
        m_out.writerSleeps.store(0, std::memory_order_relaxed);
    }
    return true;
}

void RingChannel::Close()
{
    if (m_closed.exchange(true))
        return;
    m_header->closed[m_side].store(1);
    // The peer's reader and writer look again, and so do this side's
    // (the pipe's read ends when the pipe is closed).
    SetEvent(m_outData);
    SetEvent(m_inRoom);
    m_pipe->Close();
}

} // namespace cadrosim

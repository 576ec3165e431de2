#include "PipeChannel.h"

#include <algorithm>

namespace cadrosim {

PipeChannel::PipeChannel(HANDLE pipe)
    : m_pipe(pipe), m_readEvent(CreateEventW(nullptr, TRUE, FALSE, nullptr)),
      m_writeEvent(CreateEventW(nullptr, TRUE, FALSE, nullptr))
{
}

PipeChannel::~PipeChannel()
{
    Close();
    CloseHandle(m_pipe);
    CloseHandle(m_readEvent);
    CloseHandle(m_writeEvent);
}

void PipeChannel::Close()
{
    if (!m_closed.exchange(true))
        CancelIoEx(m_pipe, nullptr);
}

bool PipeChannel::Finish(OVERLAPPED &ov, BOOL started, DWORD &bytes, DWORD timeoutMs)
{
    const DWORD begin = GetTickCount();
    // Every call that waits is a request to the Wine server: an operation
    // done at once is taken as it is, without waiting for its event.
    if (started)
        return GetOverlappedResult(m_pipe, &ov, &bytes, FALSE) != FALSE && !m_closed;
    if (GetLastError() != ERROR_IO_PENDING)
        return false;
    // A Close() between the check and the start of the operation would miss
    // it: the wait wakes up now and then to look.
    while (WaitForSingleObject(ov.hEvent, 200) == WAIT_TIMEOUT) {
        if (timeoutMs != INFINITE && GetTickCount() - begin >= timeoutMs)
            Close();
        if (m_closed) {
            CancelIoEx(m_pipe, &ov);
            break;
        }
    }
    return GetOverlappedResult(m_pipe, &ov, &bytes, TRUE) != FALSE && !m_closed;
}

bool PipeChannel::Read(std::string &buffer)
{
    return Read(buffer, INFINITE);
}

bool PipeChannel::Read(std::string &buffer, DWORD timeoutMs)
{
    if (m_closed || !m_readEvent)
        return false;
    char *room = ReadRoom();
    if (!room)
        return false;
    OVERLAPPED ov = {};
    ov.hEvent = m_readEvent;
    // Reset by hand: Wine does not reset it when the read starts, and a
    // read that then waits would find the last one's signal.
    ResetEvent(m_readEvent);
    DWORD got = 0;
    BOOL started = ReadFile(m_pipe, room, kReadChunk, &got, &ov);
    bool ok = Finish(ov, started, got, timeoutMs) || GetLastError() == ERROR_MORE_DATA;
    if (ok)
        buffer.append(room, got);
    return ok && got > 0;
}

bool PipeChannel::Write(const std::string &bytes)
{
    size_t done = 0;
    while (done < bytes.size()) {
        if (m_closed || !m_writeEvent)
            return false;
        OVERLAPPED ov = {};
        ov.hEvent = m_writeEvent;
        ResetEvent(m_writeEvent);
        DWORD put = 0;
        DWORD chunk = static_cast<DWORD>(std::min<size_t>(bytes.size() - done, 1u << 24));
        BOOL started = WriteFile(m_pipe, bytes.data() + done, chunk, &put, &ov);
        if (!Finish(ov, started, put) || put == 0)
            return false;
        done += put;
    }
    return true;
}

} // namespace cadrosim

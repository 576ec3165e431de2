#pragma once
// One end of a byte pipe opened for overlapped I/O (blocking I/O on one
// handle would run the reader and the writer one after the other).
#include "Channel.h"

#include <windows.h>

#include <atomic>
#include <string>

namespace cadrosim {

class PipeChannel : public Channel {
public:
    explicit PipeChannel(HANDLE pipe); // takes the handle over
    ~PipeChannel() override;
    PipeChannel(const PipeChannel &) = delete;
    PipeChannel &operator=(const PipeChannel &) = delete;

    bool Read(std::string &buffer) override;
    // Read, given up (false, the pipe closed) after timeoutMs.
    bool Read(std::string &buffer, DWORD timeoutMs);
    bool Write(const std::string &bytes) override;
    void Close() override;
    bool Closed() const { return m_closed.load(std::memory_order_relaxed); }
    HANDLE Handle() const { return m_pipe; }

private:
    bool Finish(OVERLAPPED &ov, BOOL started, DWORD &bytes, DWORD timeoutMs = INFINITE);

    HANDLE m_pipe;
    HANDLE m_readEvent;
    HANDLE m_writeEvent;
    std::atomic<bool> m_closed{false};
};

} // namespace cadrosim

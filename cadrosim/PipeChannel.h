#pragma once
// One end of a byte pipe opened for overlapped I/O, read by one thread and
// written by another at the same time (blocking I/O on one handle would run
// them one after the other). Close() from any thread ends both.
#include <windows.h>

#include <atomic>
#include <string>

namespace cadrosim {

class PipeChannel {
public:
    explicit PipeChannel(HANDLE pipe); // takes the handle over
    ~PipeChannel();
    PipeChannel(const PipeChannel &) = delete;
    PipeChannel &operator=(const PipeChannel &) = delete;

    // Appends what arrives (waiting for at least one byte); false when the
    // pipe broke or was closed.
    bool Read(std::string &buffer);
    // Writes all of bytes; false when the pipe broke or was closed.
    bool Write(const std::string &bytes);
    void Close();
    bool Closed() const { return m_closed; }

private:
    bool Finish(OVERLAPPED &ov, BOOL started, DWORD &bytes);

    HANDLE m_pipe;
    HANDLE m_readEvent;
    HANDLE m_writeEvent;
    std::atomic<bool> m_closed{false};
};

} // namespace cadrosim

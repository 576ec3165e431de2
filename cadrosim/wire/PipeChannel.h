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
    bool Write(const std::string &bytes) override;
    void Close() override;

private:
    bool Finish(OVERLAPPED &ov, BOOL started, DWORD &bytes);

    HANDLE m_pipe;
    HANDLE m_readEvent;
    HANDLE m_writeEvent;
    std::atomic<bool> m_closed{false};
};

} // namespace cadrosim

#pragma once
// A byte stream between a library and a node, or between two nodes: read by
// one thread and written by another at the same time. Close() from any
// thread ends both directions and wakes a read or write under way.
#include <cstddef>
#include <memory>
#include <new>
#include <string>

namespace cadrosim {

class Channel {
public:
    virtual ~Channel() = default;
    // Appends what arrives (waiting for at least one byte); false when the
    // stream broke or was closed.
    virtual bool Read(std::string &buffer) = 0;
    // Writes all of bytes; false when the stream broke or was closed.
    virtual bool Write(const std::string &bytes) = 0;
    virtual void Close() = 0;

protected:
    static constexpr size_t kReadChunk = 256 * 1024;
    // The reading thread's room for one read (null when memory is short):
    // what arrives is appended to the caller's buffer from there, rather
    // than the caller's buffer being grown by a chunk of zeros first, for a
    // read that mostly brings one small frame.
    char *ReadRoom()
    {
        if (!m_readRoom)
            m_readRoom.reset(new (std::nothrow) char[kReadChunk]);
        return m_readRoom.get();
    }

private:
    std::unique_ptr<char[]> m_readRoom;
};

} // namespace cadrosim

#pragma once
// A byte stream between a library and a node, or between two nodes: read by
// one thread and written by another at the same time. Close() from any
// thread ends both directions and wakes a read or write under way.
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
};

} // namespace cadrosim

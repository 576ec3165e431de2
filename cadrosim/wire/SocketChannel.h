#pragma once
// A TCP connection between two network nodes, as a Channel: blocking
// sends and receives on their own threads; Close() shuts the connection down,
// which ends a receive or send under way.
#include "Channel.h"

#include <winsock2.h>

#include <atomic>
#include <memory>

namespace cadrosim {

// Winsock for this process, started once; false when it cannot be.
bool StartSockets();

// "host:port" (a name, an IPv4 address or a bracketed IPv6 address) split in
// two; false when malformed.
bool SplitNodeAddress(const std::wstring &address, std::wstring &host, std::wstring &port);

// Sends values as they are made and finds a vanished peer out.
void TuneSocket(SOCKET s);

class SocketChannel : public Channel {
public:
    explicit SocketChannel(SOCKET socket); // takes the socket over
    ~SocketChannel() override;
    SocketChannel(const SocketChannel &) = delete;
    SocketChannel &operator=(const SocketChannel &) = delete;

    // Connects to a node's address; null when it cannot within timeoutMs.
    static std::unique_ptr<SocketChannel> Connect(const std::wstring &address, DWORD timeoutMs);

    bool Read(std::string &buffer) override;
    bool Write(const std::string &bytes) override;
    void Close() override;

private:
    SOCKET m_socket;
    std::atomic<bool> m_closed{false};
};

} // namespace cadrosim

#pragma once
// A network node's TCP port, for the nodes of other machines: its event is
// signalled when connections wait, and Accept() takes them.
#include "SocketChannel.h"

#include <memory>
#include <string>

namespace cadrosim {

class TcpListener {
public:
    TcpListener() = default;
    ~TcpListener();
    TcpListener(const TcpListener &) = delete;
    TcpListener &operator=(const TcpListener &) = delete;

    // Listens on "[host:]port"; without a host, on the loopback address only
    // (a node answers other machines only when told to). False with why.
    bool Open(const std::wstring &address, std::wstring &error);
    HANDLE Event() const { return m_event; }
    // The next waiting connection; null when none waits.
    std::unique_ptr<SocketChannel> Accept();

private:
    SOCKET m_socket = INVALID_SOCKET;
    HANDLE m_event = nullptr;
};

} // namespace cadrosim

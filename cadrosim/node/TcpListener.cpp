#include "TcpListener.h"

#include <ws2tcpip.h>

namespace cadrosim {

TcpListener::~TcpListener()
{
    if (m_socket != INVALID_SOCKET)
        closesocket(m_socket);
    if (m_event)
        WSACloseEvent(m_event);
}

bool TcpListener::Open(const std::wstring &address, std::wstring &error)
{
    std::wstring host, port;
    if (address.find_first_not_of(L"0123456789") == std::wstring::npos) {
        host = L"127.0.0.1";
        port = address;
    } else if (!SplitNodeAddress(address, host, port)) {
        error = L"'" + address + L"' is not [host:]port";
        return false;
    }
    if (!StartSockets()) {
        error = L"no sockets on this machine";
        return false;
    }
    ADDRINFOW hints = {};
    hints.ai_family = AF_UNSPEC;
    hints.ai_socktype = SOCK_STREAM;
    hints.ai_protocol = IPPROTO_TCP;
    hints.ai_flags = AI_PASSIVE;
    ADDRINFOW *found = nullptr;
    if (GetAddrInfoW(host.c_str(), port.c_str(), &hints, &found) != 0 || !found) {
        error = L"cannot resolve " + host;
        return false;
    }
    m_socket = socket(found->ai_family, found->ai_socktype, found->ai_protocol);
    // Another program on the port must make this node fail, not share it.
    BOOL exclusive = TRUE;
    if (m_socket != INVALID_SOCKET)
        setsockopt(m_socket, SOL_SOCKET, SO_EXCLUSIVEADDRUSE, reinterpret_cast<const char *>(&exclusive),
                   sizeof exclusive);
    bool listening = m_socket != INVALID_SOCKET &&
                     bind(m_socket, found->ai_addr, static_cast<int>(found->ai_addrlen)) == 0 &&
                     listen(m_socket, SOMAXCONN) == 0;
    FreeAddrInfoW(found);
    m_event = listening ? WSACreateEvent() : nullptr;
    if (!m_event || WSAEventSelect(m_socket, m_event, FD_ACCEPT) != 0) {
        error = L"cannot listen on " + address + L" (error " + std::to_wstring(WSAGetLastError()) + L")";
        return false;
    }
    return true;
}

std::unique_ptr<SocketChannel> TcpListener::Accept()
{
    WSANETWORKEVENTS happened;
    WSAEnumNetworkEvents(m_socket, m_event, &happened); // resets the event
    SOCKET s = accept(m_socket, nullptr, nullptr);
    if (s == INVALID_SOCKET)
        return nullptr;
    // An accepted socket inherits the listener's event and non-blocking
    // mode; a session reads and writes it blocking, each on its thread.
    WSAEventSelect(s, nullptr, 0);
    u_long blocking = 0;
    ioctlsocket(s, FIONBIO, &blocking);
    TuneSocket(s);
    return std::make_unique<SocketChannel>(s);
}

} // namespace cadrosim

#include "SocketChannel.h"

#include <ws2tcpip.h>

#include <algorithm>

namespace cadrosim {

namespace {
constexpr int kLargestSend = 64 * 1024;
constexpr long kLookMs = 200;

// Whether the socket can be read (or written) now, waiting up to kLookMs.
bool Ready(SOCKET s, bool forWrite)
{
    fd_set set;
    FD_ZERO(&set);
    FD_SET(s, &set);
    timeval wait = {0, kLookMs * 1000};
    return select(0, forWrite ? nullptr : &set, forWrite ? &set : nullptr, nullptr, &wait) != 0;
}

// Connects one resolved address, giving up after timeoutMs.
SOCKET ConnectOne(const ADDRINFOW &a, DWORD timeoutMs)
{
    SOCKET s = socket(a.ai_family, a.ai_socktype, a.ai_protocol);
    if (s == INVALID_SOCKET)
        return s;
    u_long nonBlocking = 1;
    ioctlsocket(s, FIONBIO, &nonBlocking);
    bool connected = connect(s, a.ai_addr, static_cast<int>(a.ai_addrlen)) == 0;
    if (!connected && WSAGetLastError() == WSAEWOULDBLOCK) {
        fd_set writable, failed;
        FD_ZERO(&writable);
        FD_ZERO(&failed);
        FD_SET(s, &writable);
        FD_SET(s, &failed);
        timeval wait = {static_cast<long>(timeoutMs / 1000), static_cast<long>(timeoutMs % 1000) * 1000};
        connected = select(0, nullptr, &writable, &failed, &wait) == 1 && FD_ISSET(s, &writable);
    }
    u_long blocking = 0;
    if (!connected || ioctlsocket(s, FIONBIO, &blocking) != 0) {
        closesocket(s);
        return INVALID_SOCKET;
    }
    TuneSocket(s);
    return s;
}
} // namespace

void TuneSocket(SOCKET s)
{
    // No waiting to fill a segment; a peer that vanished without a word is
    // found out by the keep-alive.
    BOOL on = TRUE;
    setsockopt(s, IPPROTO_TCP, TCP_NODELAY, reinterpret_cast<const char *>(&on), sizeof on);
    setsockopt(s, SOL_SOCKET, SO_KEEPALIVE, reinterpret_cast<const char *>(&on), sizeof on);
}

bool StartSockets()
{
    static const bool started = [] {
        WSADATA data;
        return WSAStartup(MAKEWORD(2, 2), &data) == 0;
    }();
    return started;
}

bool SplitNodeAddress(const std::wstring &address, std::wstring &host, std::wstring &port)
{
    size_t colon = address.rfind(L':');
    if (colon == std::wstring::npos || colon == 0 || colon + 1 == address.size())
        return false;
    host = address.substr(0, colon);
    port = address.substr(colon + 1);
    if (host.size() >= 2 && host.front() == L'[' && host.back() == L']')
        host = host.substr(1, host.size() - 2);
    else if (host.find(L':') != std::wstring::npos)
        return false; // an IPv6 address needs its brackets
    wchar_t *end = nullptr;
    unsigned long number = wcstoul(port.c_str(), &end, 10);
    return !host.empty() && *end == L'\0' && number > 0 && number < 65536 &&
           port.find_first_not_of(L"0123456789") == std::wstring::npos;
}

std::unique_ptr<SocketChannel> SocketChannel::Connect(const std::wstring &address, DWORD timeoutMs)
{
    std::wstring host, port;
    if (!StartSockets() || !SplitNodeAddress(address, host, port))
        return nullptr;
    ADDRINFOW hints = {};
    hints.ai_family = AF_UNSPEC;
    hints.ai_socktype = SOCK_STREAM;
    hints.ai_protocol = IPPROTO_TCP;
    ADDRINFOW *found = nullptr;
    if (GetAddrInfoW(host.c_str(), port.c_str(), &hints, &found) != 0)
        return nullptr;
    SOCKET s = INVALID_SOCKET;
    for (ADDRINFOW *a = found; a && s == INVALID_SOCKET; a = a->ai_next)
        s = ConnectOne(*a, timeoutMs);
    FreeAddrInfoW(found);
    return s == INVALID_SOCKET ? nullptr : std::make_unique<SocketChannel>(s);
}

SocketChannel::SocketChannel(SOCKET socket) : m_socket(socket) {}

SocketChannel::~SocketChannel()
{
    Close();
    closesocket(m_socket);
}

void SocketChannel::Close()
{
    // The socket itself stays open until the object goes: a thread still
    // inside recv or send must not meet a handle reused for something else.
    // Under Wine a shutdown does not end a receive under way: the reader and
    // the writer look at the flag every kLookMs, and a send stuck on a full
    // window is cancelled.
    if (!m_closed.exchange(true)) {
        shutdown(m_socket, SD_BOTH);
        CancelIoEx(reinterpret_cast<HANDLE>(m_socket), nullptr);
    }
}

bool SocketChannel::Read(std::string &buffer)
{
    while (!m_closed && !Ready(m_socket, false)) {
    }
    if (m_closed)
        return false;
    char *room = ReadRoom();
    if (!room)
        return false;
    int got = recv(m_socket, room, static_cast<int>(kReadChunk), 0);
    if (got > 0)
        buffer.append(room, static_cast<size_t>(got));
    return got > 0 && !m_closed;
}

bool SocketChannel::Write(const std::string &bytes)
{
    size_t done = 0;
    while (done < bytes.size()) {
        while (!m_closed && !Ready(m_socket, true)) {
        }
        if (m_closed)
            return false;
        int chunk = static_cast<int>(std::min<size_t>(bytes.size() - done, kLargestSend));
        int put = send(m_socket, bytes.data() + done, chunk, 0);
        if (put <= 0)
            return false;
        done += static_cast<size_t>(put);
    }
    return true;
}

} // namespace cadrosim

#include "Platform/Networking.h"

#include <fcntl.h>
#include <limits.h>
#include <netdb.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>

#include "Platform/NetworkingInternal.h"
#include "core/0ReusePool.h"

namespace Korvel::Platform {

struct _SocketAddress : Reuser {
    sockaddr_in m_Name;
};
static_assert(sizeof(_SocketAddress) == 16);

int SocketDescriptor(const _Socket* socket) {
    intptr_t number = reinterpret_cast<intptr_t>(socket);
    return number > 0 && number <= INT_MAX ? static_cast<int>(number) : -1;
}

int AwayFromStreams(int fd) {
    if (fd < 0 || fd > STDERR_FILENO) return fd;
    int moved = fcntl(fd, F_DUPFD_CLOEXEC, STDERR_FILENO + 1);
    close(fd);
    return moved;
}

bool RefuseArgument() {
    errno = EINVAL;
    return false;
}

namespace {

_Socket* ToSocket(int fd) {
    return reinterpret_cast<_Socket*>(static_cast<intptr_t>(AwayFromStreams(fd)));
}

bool FillName(sockaddr_in& name, unsigned int port, unsigned int ip) {
    if (port > UINT16_MAX) return RefuseArgument();
    name = {};
    name.sin_family = AF_INET;
    name.sin_port = htons(static_cast<uint16_t>(port));
    name.sin_addr.s_addr = ip;
    return true;
}

// Asks for the name of one end of a socket with getsockname or getpeername.
bool ReadName(decltype(getsockname)* read, _Socket* socket, sockaddr_in& name) {
    socklen_t size = sizeof(name);
    if (read(SocketDescriptor(socket), reinterpret_cast<sockaddr*>(&name), &size) != 0)
        return false;
    return name.sin_family == AF_INET || RefuseArgument();
}

// Makes a call that moves bytes, again when a signal has interrupted it, and gives their number. A
// zero that is no failure leaves no error behind: otherwise an orderly close would read as whatever
// has failed before.
template <class Call>
unsigned int Transfer(int length, Call call) {
    if (length < 0) return RefuseArgument();
    ssize_t moved;
    do {
        moved = call(static_cast<size_t>(length));
    } while (moved < 0 && errno == EINTR);
    if (moved < 0) return 0;
    if (moved == 0) errno = 0;
    return static_cast<unsigned int>(moved);
}

unsigned int ReceiveNamed(_Socket* socket, void* data, int length, sockaddr_in& sender) {
    return Transfer(length, [&](size_t size) {
        socklen_t nameSize = sizeof(sender);
        return recvfrom(SocketDescriptor(socket), data, size, 0,
                        reinterpret_cast<sockaddr*>(&sender), &nameSize);
    });
}

// A connect that a signal has interrupted goes on by itself; a second one would be refused.
bool FinishConnect(int fd) {
    pollfd entry = {fd, POLLOUT, 0};
    while (poll(&entry, 1, -1) < 0) {
        if (errno != EINTR) return false;
    }
    int error = 0;
    socklen_t size = sizeof(error);
    if (getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &size) != 0) return false;
    errno = error;
    return error == 0;
}

template <class Value>
bool SetOption(_Socket* socket, int level, int option, const Value& value) {
    return setsockopt(SocketDescriptor(socket), level, option, &value, sizeof(value)) == 0;
}
bool SetFlag(_Socket* socket, int level, int option, bool on) {
    return SetOption(socket, level, option, int{on});
}

// The resolver has errors of its own; only one of them means that errno tells more.
bool IsResolved(int error) {
    if (error != 0 && error != EAI_SYSTEM) errno = ENOENT;
    return error == 0;
}

}  // namespace

SocketError GetSocketError() {
    switch (errno) {
        case 0:
            return SERR_NONE;
        case ETIMEDOUT:
            return SERR_TIMEDOUT;
        case EINPROGRESS:
            return SERR_INPROGRESS;
        case EAGAIN:
            return SERR_WOULDBLOCK;
        default:
            return SERR_FAILED;
    }
}

_Socket* NewSocket(SocketType type) {
    switch (type) {
        case ST_TCP:
            return ToSocket(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        case ST_UDP:
            return ToSocket(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    }
    RefuseArgument();
    return ToSocket(-1);
}

bool DeleteSocket(_Socket* socket) {
    // An interrupted close has closed all the same, and a second one might hit somebody else's.
    return close(SocketDescriptor(socket)) == 0 || errno == EINTR;
}

bool BindSocket(_Socket* socket, unsigned int port, unsigned int ip) {
    sockaddr_in name;
    return FillName(name, port, ip) &&
           bind(SocketDescriptor(socket), reinterpret_cast<sockaddr*>(&name), sizeof(name)) == 0;
}

bool ConnectSocket(_Socket* socket, unsigned int port, unsigned int ip) {
    sockaddr_in name;
    if (!FillName(name, port, ip)) return false;
    int fd = SocketDescriptor(socket);
    if (connect(fd, reinterpret_cast<sockaddr*>(&name), sizeof(name)) == 0) return true;
    return errno == EINTR && FinishConnect(fd);
}

bool ListenSocket(_Socket* socket, int backlog) {
    constexpr int kDefaultBacklog = 128;
    return listen(SocketDescriptor(socket), backlog < 1 ? kDefaultBacklog : backlog) == 0;
}

_Socket* AcceptSocket(_Socket* socket) {
    int fd;
    do {
        fd = accept4(SocketDescriptor(socket), nullptr, nullptr, SOCK_CLOEXEC);
    } while (fd < 0 && errno == EINTR);
    return ToSocket(fd);
}

unsigned int SocketSend(_Socket* socket, const void* data, int length) {
    return Transfer(length, [&](size_t size) {
        return send(SocketDescriptor(socket), data, size, MSG_NOSIGNAL);
    });
}

unsigned int SocketSendMore(_Socket* socket, const void* data, int length) {
    return Transfer(length, [&](size_t size) {
        return send(SocketDescriptor(socket), data, size, MSG_NOSIGNAL | MSG_MORE);
    });
}

unsigned int SocketReceive(_Socket* socket, void* data, int length, unsigned int* port,
                           unsigned int* ip) {
    if (!port || !ip) {
        return Transfer(length,
                        [&](size_t size) { return recv(SocketDescriptor(socket), data, size, 0); });
    }
    sockaddr_in sender = {};
    unsigned int moved = ReceiveNamed(socket, data, length, sender);
    if (moved) {
        *port = ntohs(sender.sin_port);
        *ip = sender.sin_addr.s_addr;
    }
    return moved;
}

unsigned int SocketSendTo(_Socket* socket, const void* data, int length, const _SocketAddress* to) {
    if (!to) return RefuseArgument();
    return Transfer(length, [&](size_t size) {
        return sendto(SocketDescriptor(socket), data, size, MSG_NOSIGNAL,
                      reinterpret_cast<const sockaddr*>(&to->m_Name), sizeof(to->m_Name));
    });
}

unsigned int SocketReceiveFrom(_Socket* socket, void* data, int length, _SocketAddress* from) {
    if (!from) return RefuseArgument();
    return ReceiveNamed(socket, data, length, from->m_Name);
}

_SocketAddress* NewSocketAddress(unsigned int port, unsigned int ip) {
    sockaddr_in name;
    if (!FillName(name, port, ip)) return nullptr;
    _SocketAddress* address = new _SocketAddress;
    if (address) address->m_Name = name;
    return address;
}

_SocketAddress* GetSocketAddress(_Socket* socket) {
    sockaddr_in name;
    if (!ReadName(getsockname, socket, name)) return nullptr;
    return NewSocketAddress(ntohs(name.sin_port), name.sin_addr.s_addr);
}

bool DeleteSocketAddress(_SocketAddress* address) {
    delete address;
    return address != nullptr;
}

unsigned int SocketAddressGetPort(const _SocketAddress* address) {
    return address ? ntohs(address->m_Name.sin_port) : 0;
}
unsigned int SocketAddressGetIP(const _SocketAddress* address) {
    return address ? address->m_Name.sin_addr.s_addr : 0;
}

unsigned int GetSocketPeerIP(_Socket* socket, unsigned int* port) {
    sockaddr_in name;
    if (!ReadName(getpeername, socket, name)) return 0;
    if (port) *port = name.sin_port;
    return name.sin_addr.s_addr;
}

bool SetSocketLinger(_Socket* socket, bool on, int seconds) {
    return SetOption(socket, SOL_SOCKET, SO_LINGER, linger{on, seconds});
}
bool SetSocketReuseAddress(_Socket* socket, bool on) {
    return SetFlag(socket, SOL_SOCKET, SO_REUSEADDR, on);
}
bool SetSocketBroadcast(_Socket* socket, bool on) {
    return SetFlag(socket, SOL_SOCKET, SO_BROADCAST, on);
}
bool SetSocketNoDelay(_Socket* socket, bool on) {
    return SetFlag(socket, IPPROTO_TCP, TCP_NODELAY, on);
}
bool SetSocketNonBlocking(_Socket* socket, bool on) {
    int flag = on;
    return ioctl(SocketDescriptor(socket), FIONBIO, &flag) == 0;
}
bool SetSocketExclusiveAddress(_Socket* socket, bool on) {
    return false;
}
bool SetSocketFastLoopback(_Socket* socket, bool on) {
    return false;
}

bool SetSocketKeepAlive(_Socket* socket, int idleSeconds, int intervalSeconds, int count) {
    return SetOption(socket, IPPROTO_TCP, TCP_KEEPIDLE, idleSeconds) &&
           SetOption(socket, IPPROTO_TCP, TCP_KEEPINTVL, intervalSeconds) &&
           SetOption(socket, IPPROTO_TCP, TCP_KEEPCNT, count) &&
           SetFlag(socket, SOL_SOCKET, SO_KEEPALIVE, true);
}

bool SetSocketReadThreshold(_Socket* socket, int bytes) {
    return SetOption(socket, SOL_SOCKET, SO_RCVLOWAT, bytes);
}

bool GetSocketSilence(_Socket* socket, SocketSilence& silence) {
    tcp_info info = {};
    socklen_t size = sizeof(info);
    if (getsockopt(SocketDescriptor(socket), IPPROTO_TCP, TCP_INFO, &info, &size) != 0)
        return false;
    silence = {info.tcpi_last_ack_recv, info.tcpi_unacked > 0 || info.tcpi_probes > 0};
    return true;
}

bool ShutdownSocket(_Socket* socket, unsigned int how) {
    switch (how & 3) {
        case 1:
            return shutdown(SocketDescriptor(socket), SHUT_RD) == 0;
        case 2:
            return shutdown(SocketDescriptor(socket), SHUT_WR) == 0;
        case 3:
            return shutdown(SocketDescriptor(socket), SHUT_RDWR) == 0;
        default:
            return RefuseArgument();
    }
}

bool GetHostName(char* buffer, int length) {
    if (!buffer || length <= 0) return RefuseArgument();
    return gethostname(buffer, static_cast<size_t>(length)) == 0;
}

bool GetHostByAddr(unsigned int ip, char* buffer, int length) {
    if (!buffer || length <= 0) return RefuseArgument();
    sockaddr_in address;
    FillName(address, 0, ip);
    char name[NI_MAXHOST];
    if (!IsResolved(getnameinfo(reinterpret_cast<sockaddr*>(&address), sizeof(address), name,
                                sizeof(name), nullptr, 0, NI_NAMEREQD))) {
        return false;
    }
    memcpy(buffer, name, std::min(strlen(name) + 1, static_cast<size_t>(length)));
    return true;
}

unsigned int GetHostByName(const char* name) {
    if (!name) return RefuseArgument();
    addrinfo hints = {};
    hints.ai_family = AF_INET;
    hints.ai_socktype = SOCK_STREAM;
    addrinfo* first = nullptr;
    if (!IsResolved(getaddrinfo(name, nullptr, &hints, &first))) return 0;
    sockaddr_in address;
    memcpy(&address, first->ai_addr, sizeof(address));
    freeaddrinfo(first);
    return address.sin_addr.s_addr;
}

}  // namespace Korvel::Platform

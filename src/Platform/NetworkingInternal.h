#pragma once

#include <array>
#include <bit>
#include <cstdint>

#include "Platform/Networking.h"

namespace Korvel::Platform {

// What stands for a socket where there is none.
inline _Socket* const kNoSocket = reinterpret_cast<_Socket*>(intptr_t{-1});

// The descriptor of a socket. For what is none it is -1, which the system refuses.
int SocketDescriptor(const _Socket* socket);

// Moves a descriptor away from the three standard ones, which are free when the host has closed its
// streams: what the process prints must not go into a socket or a pipe. Takes `fd` over; -1, which
// it also may be, when there are no more descriptors.
int AwayFromStreams(int fd);

// Has the system ask a peer that says nothing for `idleSeconds` for a sign of life, every
// `intervalSeconds`, and end the connection after `count` questions without an answer.
bool SetSocketKeepAlive(_Socket* socket, int idleSeconds, int intervalSeconds, int count);

// The bytes that have to be there before a wait finds the socket readable; 1 at first.
bool SetSocketReadThreshold(_Socket* socket, int bytes);

// SocketSend for bytes that others follow at once: the system may keep them until then.
unsigned int SocketSendMore(_Socket* socket, const void* data, int length);

// How long a peer has given no sign of life, and whether it owes one: for bytes that were sent, or
// for a question of the system's own. Between such questions a peer that lives, but takes no bytes,
// may be silent for two minutes, and owes nothing.
struct SocketSilence {
    unsigned int m_Ms;
    bool m_IsOwed;
};
bool GetSocketSilence(_Socket* socket, SocketSilence& silence);

// Whether an address never leaves this machine: 127.0.0.0 to 127.255.255.255.
inline bool IsLoopback(unsigned int ip) {
    return std::bit_cast<std::array<unsigned char, 4>>(ip)[0] == 127;
}

// Makes errno tell that an argument is wrong. Always false.
bool RefuseArgument();

}  // namespace Korvel::Platform

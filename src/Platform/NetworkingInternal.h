#pragma once

#include "Platform/Networking.h"

namespace Korvel::Platform {

// The descriptor of a socket. For what is none it is -1, which the system refuses.
int SocketDescriptor(const _Socket* socket);

// Moves a descriptor away from the three standard ones, which are free when the host has closed its
// streams: what the process prints must not go into a socket or a pipe. Takes `fd` over; -1, which
// it also may be, when there are no more descriptors.
int AwayFromStreams(int fd);

// Makes errno tell that an argument is wrong. Always false.
bool RefuseArgument();

}  // namespace Korvel::Platform

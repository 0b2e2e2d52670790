#pragma once

#include "Platform/NetworkingInternal.h"

namespace Korvel {

// The address at which this process listens, and finds the script server: KORVEL_ListenAddress, any
// (0) by default. False, with a line in the log, when that is no address: a mistake must not open
// the process to everybody.
bool GetListenAddress(unsigned int& ip);

// A socket at which peers call. It belongs to one thread, which waits on it with a set of its own.
class Listener {
public:
    Listener() = default;
    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;
    ~Listener();

    // False, with errno set: EADDRINUSE when somebody else is there. Two sockets may be bound to
    // one port as long as neither listens, so a port is tried whole.
    bool Open(unsigned int port, unsigned int ip);
    bool IsOpen() const { return m_Socket != Platform::kNoSocket; }

    // For a set: whoever calls shows as SE_ACCEPT.
    Platform::_Socket* GetSocket() const { return m_Socket; }

    // The socket of one who calls, for an AcceptedApp; the caller's. kNoSocket, with errno set,
    // when there is none after all. Ends connections that say nothing, when there are many. Without
    // more descriptors those who call are turned away, and what cannot be helped makes it pause a
    // tenth of a second, for its thread is woken again at once.
    Platform::_Socket* Accept();

private:
    void TurnAway();

    Platform::_Socket* m_Socket = Platform::kNoSocket;
    // Kept for the time when there are no more descriptors: given up, it lets a caller in, to be
    // turned away. One that is left in the queue of the socket wakes the thread for ever.
    Platform::_Socket* m_Spare = Platform::kNoSocket;
};

}  // namespace Korvel

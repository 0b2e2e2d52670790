#pragma once

#include "core/Export.h"

// IPv4 sockets, and sets of them that one thread sleeps on while others can wake it.
//
// A _Socket* is no pointer: it is the descriptor itself, widened. -1 is no socket, and so is 0; no
// socket that is made here has one of the three standard descriptors.
// An IP address is an unsigned int in network byte order, 0 for any address. A port is one in host
// byte order, at most 65535.
//
// Threads: any thread may use any socket. A set belongs to the thread that waits on it, but any
//          thread may call SocketSetEvent.
// Failure: false, 0, null or -1, as told. GetSocketError has the reason, also where 0 may mean that
//          nothing happened: it is SERR_NONE then. What is no socket, address or set is refused.
// Signals: none interrupts an operation, and writing to a peer that is gone raises none. What is
//          opened here is closed in programs that this one executes.
namespace Korvel::Platform {

struct _Socket;
struct _SocketAddress;
struct _SocketSet;

enum SocketType : unsigned int {
    ST_TCP = 1,
    ST_UDP = 2,
};

// What an entry of a set waits for, and what has happened to it: bits. Whatever is readable reports
// SE_READ and SE_ACCEPT, whatever is writable SE_WRITE and SE_CONNECT. Errors wake the waiter, too,
// and have no bit.
enum SocketEvents : unsigned int {
    SE_READ = 1,
    SE_WRITE = 2,
    SE_CLOSE = 4,    // both directions are shut
    SE_CONNECT = 8,  // waits for all that can happen, whatever stands beside it
    SE_ACCEPT = 16,
};

enum SocketError : unsigned int {
    SERR_NONE = 0,
    SERR_FAILED = 1,  // any that has no name here
    SERR_TIMEDOUT = 2,
    SERR_INPROGRESS = 3,
    SERR_WOULDBLOCK = 4,
};

// Why the calling thread's latest operation failed. Ask before any other call: it is errno.
KORVEL_EXPORT SocketError GetSocketError();

// The caller owns a socket until DeleteSocket. -1 for an unknown type or when there are no more.
KORVEL_EXPORT _Socket* NewSocket(SocketType type);
KORVEL_EXPORT bool DeleteSocket(_Socket* socket);

KORVEL_EXPORT bool BindSocket(_Socket* socket, unsigned int port, unsigned int ip);

// On a non-blocking socket false with SERR_INPROGRESS or SERR_WOULDBLOCK means that it goes on.
KORVEL_EXPORT bool ConnectSocket(_Socket* socket, unsigned int port, unsigned int ip);

KORVEL_EXPORT bool ListenSocket(_Socket* socket, int backlog);  // below 1 it becomes 128
KORVEL_EXPORT _Socket* AcceptSocket(_Socket* socket);           // the caller's; -1 when it fails

// Transfers give the bytes moved, which may be fewer than `length`. A peer's orderly close and an
// empty datagram read as 0 without an error. What of a datagram is longer than `length` is lost.
KORVEL_EXPORT unsigned int SocketSend(_Socket* socket, const void* data, int length);

//   port, ip  take the sender's, if both are given and bytes came; 0 on a stream
KORVEL_EXPORT unsigned int SocketReceive(_Socket* socket, void* data, int length,
                                         unsigned int* port, unsigned int* ip);

// One datagram to an address, and one from anywhere, whose sender `from` becomes.
KORVEL_EXPORT unsigned int SocketSendTo(_Socket* socket, const void* data, int length,
                                        const _SocketAddress* to);
KORVEL_EXPORT unsigned int SocketReceiveFrom(_Socket* socket, void* data, int length,
                                             _SocketAddress* from);

// The caller owns an address until DeleteSocketAddress, which is false for null. They are null when
// memory has run out, for a port that is none and for a socket without a name.
KORVEL_EXPORT _SocketAddress* NewSocketAddress(unsigned int port, unsigned int ip);
KORVEL_EXPORT _SocketAddress* GetSocketAddress(_Socket* socket);  // the local name
KORVEL_EXPORT bool DeleteSocketAddress(_SocketAddress* address);
KORVEL_EXPORT unsigned int SocketAddressGetPort(const _SocketAddress* address);  // 0 for null
KORVEL_EXPORT unsigned int SocketAddressGetIP(const _SocketAddress* address);    // 0 for null

// The IP at the other end; 0, with nothing stored, when there is none.
//   port  if given, takes the port, which stays in network byte order here
KORVEL_EXPORT unsigned int GetSocketPeerIP(_Socket* socket, unsigned int* port);

KORVEL_EXPORT bool SetSocketLinger(_Socket* socket, bool on, int seconds);
KORVEL_EXPORT bool SetSocketReuseAddress(_Socket* socket, bool on);
KORVEL_EXPORT bool SetSocketBroadcast(_Socket* socket, bool on);
KORVEL_EXPORT bool SetSocketNoDelay(_Socket* socket, bool on);
KORVEL_EXPORT bool SetSocketNonBlocking(_Socket* socket, bool on);

// Of other systems; they have no effect and are false.
KORVEL_EXPORT bool SetSocketExclusiveAddress(_Socket* socket, bool on);
KORVEL_EXPORT bool SetSocketFastLoopback(_Socket* socket, bool on);

//   how  bit 1 stops receiving, bit 2 sending; without either nothing is done and it is false
KORVEL_EXPORT bool ShutdownSocket(_Socket* socket, unsigned int how);

KORVEL_EXPORT bool GetHostName(char* buffer, int length);  // of this machine

// The name of a machine. It has no end in `buffer` when it fills all of its `length` bytes.
KORVEL_EXPORT bool GetHostByAddr(unsigned int ip, char* buffer, int length);

// The first IPv4 address of a machine, or 0. It may wait for name servers.
KORVEL_EXPORT unsigned int GetHostByName(const char* name);

// A set for at most `maxSockets` sockets, at most 65535. The caller owns it until DeleteSocketSet,
// which leaves the sockets alone and is false for null. Null when memory has run out.
KORVEL_EXPORT _SocketSet* NewSocketSet(int maxSockets);
KORVEL_EXPORT bool DeleteSocketSet(_SocketSet* set);

// Adds a socket, which waits for `events` from the next wait on, and returns its index, counted
// from 1; 0 when the set is full.
// With socket 0 it registers a wake-up and returns its number, counted from 128; 0 when there is no
// descriptor for it, after number 255, and in a set for more than 127 sockets, whose indexes would
// look like wake-ups. The first of them comes before another thread uses the set.
KORVEL_EXPORT int AddSocketSet(_SocketSet* set, _Socket* socket, unsigned int events);

// Replaces what an entry waits for. Nothing happens for an index that is none.
KORVEL_EXPORT void ModifySocketSetEvents(_SocketSet* set, int index, unsigned int events);

// Sleeps until a wake-up has come or something has happened to a socket. Wake-ups go first, in the
// order in which they were sent, one for each wait.
//   timeoutMs  0 only looks; 0x80000000 and above has no limit
//   returns    the number of the wake-up, else the index of the first socket with an event or an
//              error, 0 when the time is over, -1 when the wait failed
KORVEL_EXPORT int WaitSocketSet(_SocketSet* set, unsigned int timeoutMs);

// Wakes the waiter, or the next wait, with a number from 128 to 255. It never blocks. A number that
// is still to be waited for is not sent again. False when no wake-up was registered.
KORVEL_EXPORT bool SocketSetEvent(_SocketSet* set, int number);

// What the last wait has found at an entry, whatever it returned; 0 for an index that is none.
KORVEL_EXPORT unsigned int GetSocketSetEvents(_SocketSet* set, int index);

}  // namespace Korvel::Platform

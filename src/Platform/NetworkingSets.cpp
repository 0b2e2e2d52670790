// Sets of sockets: a poll list whose first entry is a pipe of its own, through which other threads
// wake the waiter with the number of a wake-up as one byte.
//
// A number has at most one byte in the pipe. So the pipe, which holds some thousand, is never full
// and no wake-up is lost, however many threads send them and however late the waiter comes.
#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>

#include "Platform/NetworkingInternal.h"
#include "Platform/NoKillInternal.h"
#include "Platform/TimeInternal.h"
#include "core/0ReusePool.h"

namespace Korvel::Platform {
namespace {

constexpr int kFirstWake = 128;
constexpr int kWakeCount = 128;
constexpr int kMaxSockets = 65535;  // a process that can have more sockets does not poll them
constexpr short kAllPollEvents = 511;

}  // namespace

struct _SocketSet : Reuser {
    ~_SocketSet();

    // Fixed when the first wake-up is registered, or before
    int m_Capacity = 0;
    pollfd* m_Entries = nullptr;  // entry 0 is the pipe's, the sockets follow
    int m_ReadEnd = -1;
    int m_WriteEnd = -1;

    // Waiting thread only
    int m_Count = 0;  // of the sockets
    int m_WakeCount = 0;

    // Any thread. A bit is set before its number's byte is written and cleared after it was read.
    std::atomic<uint64_t> m_Pending[kWakeCount / 64]{};
};

_SocketSet::~_SocketSet() {
    if (m_ReadEnd >= 0) close(m_ReadEnd);
    if (m_WriteEnd >= 0) close(m_WriteEnd);
    g_ReusePoolMgr.Free(m_Entries);
}

namespace {

std::atomic<uint64_t>& PendingWord(_SocketSet& set, unsigned int number) {
    return set.m_Pending[number / 64 % 2];
}
uint64_t PendingBit(unsigned int number) {
    return uint64_t{1} << number % 64;
}

short ToPollEvents(unsigned int events) {
    if (events & SE_CONNECT) return kAllPollEvents;
    return static_cast<short>((events & (SE_READ | SE_ACCEPT) ? POLLIN : 0) |
                              (events & SE_WRITE ? POLLOUT : 0) |
                              (events & SE_CLOSE ? POLLHUP : 0));
}

unsigned int FromPollEvents(short events) {
    return (events & POLLIN ? SE_READ | SE_ACCEPT : 0u) |
           (events & POLLOUT ? SE_WRITE | SE_CONNECT : 0u) | (events & POLLHUP ? SE_CLOSE : 0u);
}

bool IsEntry(const _SocketSet* set, int index) {
    return set && index >= 1 && index <= set->m_Count;
}

bool OpenPipe(_SocketSet& set) {
    int ends[2];
    if (pipe2(ends, O_CLOEXEC | O_NONBLOCK) != 0) return false;
    int readEnd = AwayFromStreams(ends[0]);
    int writeEnd = AwayFromStreams(ends[1]);
    if (readEnd < 0 || writeEnd < 0) {
        if (readEnd >= 0) close(readEnd);
        if (writeEnd >= 0) close(writeEnd);
        return false;
    }
    set.m_ReadEnd = readEnd;
    set.m_WriteEnd = writeEnd;
    set.m_Entries[0] = {readEnd, POLLIN, 0};
    return true;
}

int AddWake(_SocketSet& set) {
    if (set.m_WakeCount == kWakeCount || set.m_Capacity > kFirstWake) return RefuseArgument();
    if (set.m_ReadEnd < 0 && !OpenPipe(set)) return 0;
    return kFirstWake + set.m_WakeCount++;
}

int AddSocket(_SocketSet& set, int fd, unsigned int events) {
    if (fd < 0 || set.m_Count + 1 == set.m_Capacity) return RefuseArgument();
    int index = ++set.m_Count;
    set.m_Entries[index] = {fd, ToPollEvents(events), 0};
    return index;
}

// Takes the oldest number out of the pipe; 0 when there is none. Between its two steps a sender may
// leave his own to the byte that is taken: the waiter returns after them and finds his work.
int TakeWake(_SocketSet& set) {
    NoKill noKill;
    unsigned char number = 0;
    if (read(set.m_ReadEnd, &number, 1) != 1) return 0;
    PendingWord(set, number).fetch_and(~PendingBit(number), std::memory_order_acq_rel);
    return number;
}

// A poll that goes on with the rest of its time when a signal has interrupted it.
int Poll(pollfd* entries, int count, int timeoutMs) {
    uint64_t deadline = 0;
    if (timeoutMs > 0) {
        deadline = ReadClock(CLOCK_MONOTONIC) + static_cast<uint64_t>(timeoutMs) * kMillisecondNs;
    }
    for (;;) {
        int found = poll(entries, static_cast<nfds_t>(count), timeoutMs);
        if (found >= 0 || errno != EINTR) return found;
        if (timeoutMs > 0) {
            uint64_t now = ReadClock(CLOCK_MONOTONIC);
            uint64_t left = deadline > now ? deadline - now : 0;
            timeoutMs = static_cast<int>((left + kMillisecondNs - 1) / kMillisecondNs);
        }
    }
}

}  // namespace

_SocketSet* NewSocketSet(int maxSockets) {
    if (maxSockets < 0 || maxSockets > kMaxSockets) {
        RefuseArgument();
        return nullptr;
    }
    _SocketSet* set = new _SocketSet;
    if (!set) return nullptr;
    set->m_Capacity = maxSockets + 1;
    set->m_Entries = static_cast<pollfd*>(
        g_ReusePoolMgr.Alloc(static_cast<size_t>(set->m_Capacity) * sizeof(pollfd)));
    if (!set->m_Entries) {
        delete set;
        return nullptr;
    }
    for (int i = 0; i < set->m_Capacity; i++) set->m_Entries[i] = {-1, 0, 0};
    return set;
}

bool DeleteSocketSet(_SocketSet* set) {
    delete set;
    return set != nullptr;
}

int AddSocketSet(_SocketSet* set, _Socket* socket, unsigned int events) {
    if (!set) return RefuseArgument();
    return socket ? AddSocket(*set, SocketDescriptor(socket), events) : AddWake(*set);
}

void ModifySocketSetEvents(_SocketSet* set, int index, unsigned int events) {
    if (IsEntry(set, index)) set->m_Entries[index].events = ToPollEvents(events);
}

int WaitSocketSet(_SocketSet* set, unsigned int timeoutMs) {
    if (!set) {
        RefuseArgument();
        return -1;
    }
    int first = set->m_ReadEnd < 0 ? 1 : 0;
    int found = Poll(set->m_Entries + first, set->m_Count + 1 - first, static_cast<int>(timeoutMs));
    if (found <= 0) return found;
    if (set->m_Entries[0].revents & POLLIN) {
        if (int number = TakeWake(*set)) return number;
    }
    for (int i = 1; i <= set->m_Count; i++) {
        if (set->m_Entries[i].revents) return i;
    }
    return found;
}

bool SocketSetEvent(_SocketSet* set, int number) {
    if (!set || set->m_WriteEnd < 0 || number < kFirstWake || number >= kFirstWake + kWakeCount) {
        return RefuseArgument();
    }
    unsigned char byte = static_cast<unsigned char>(number);
    std::atomic<uint64_t>& pending = PendingWord(*set, byte);
    uint64_t bit = PendingBit(byte);
    NoKill noKill;  // a bit without its byte would keep the number from ever being sent again
    if (pending.fetch_or(bit, std::memory_order_acq_rel) & bit) return true;
    if (write(set->m_WriteEnd, &byte, 1) == 1) return true;
    pending.fetch_and(~bit, std::memory_order_acq_rel);
    return false;
}

unsigned int GetSocketSetEvents(_SocketSet* set, int index) {
    return IsEntry(set, index) ? FromPollEvents(set->m_Entries[index].revents) : 0;
}

}  // namespace Korvel::Platform

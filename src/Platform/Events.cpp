// Events on a lock and a futex word.
//
// The C library's condition variables keep books on their waiters in user space, which a waiter
// that is killed leaves wrong: others then lose wake-ups and the destruction waits for ever. Here
// the system's queue is the only book, and a killed thread leaves that by itself.
//
// Waiters sleep on m_Sequence. Whoever sets the event has the lock, and a waiter that ran at that
// moment would only bump into it and sleep again. So the signal moves the waiter over to the lock's
// queue, and it runs when the lock is let go.
#include "Platform/Events.h"

#include <climits>

#include "Platform/EventsInternal.h"
#include "Platform/ThreadInternal.h"
#include "Platform/TimeInternal.h"

namespace Korvel::Platform {

struct _Event : Reuser {
    FutexLock m_Lock;

    // Waiters sleep on it while the flag is clear; changed whenever the flag gets set.
    FutexWord m_Sequence{0};

    // Guarded by m_Lock, as is every change of m_Sequence
    uint32_t m_WaiterCount = 0;  // killed ones stay counted, at the price of a system call
    bool m_IsManual = false;
    bool m_IsSignalled = false;
};

namespace {

// Wakes whom the signal concerns while the lock is held: a waiter must not return, and perhaps
// delete the event, before we are done with it. A flag that is set already has woken whom it could.
void SetLocked(_Event& event) {
    if (event.m_IsSignalled) return;
    event.m_IsSignalled = true;
    uint32_t sequence = event.m_Sequence.fetch_add(1, std::memory_order_relaxed) + 1;
    if (!event.m_WaiterCount) return;
    event.m_Lock.TakeSleepers(event.m_Sequence, sequence, event.m_IsManual ? INT_MAX : 1);
}

// Sleeps until the flag is set, the time is over or the system refuses. The lock is held before
// and after, and the caller is inside of one NoKill guard.
void SleepUntilSet(_Event& event, unsigned int timeoutMs) {
    timespec deadline;
    bool hasLimit = timeoutMs != kNoTimeLimit;
    if (hasLimit) {
        deadline = ToTimespec(ReadClock(CLOCK_REALTIME) + uint64_t{timeoutMs} * kMillisecondNs);
    }
    event.m_WaiterCount++;
    int error = 0;
    while (!event.m_IsSignalled && (error == 0 || error == EAGAIN || error == EINTR)) {
        uint32_t seen = event.m_Sequence.load(std::memory_order_relaxed);
        event.m_Lock.Release();
        {
            KillableSleep sleep(&event.m_Sequence, &event.m_Lock.Word());
            error = FutexWait(event.m_Sequence, seen, hasLimit ? &deadline : nullptr);
        }
        event.m_Lock.ObtainAmongWaiters();
    }
    event.m_WaiterCount--;
}

}  // namespace

_Event* NewEvent(bool manualReset, bool initialState) {
    _Event* event = new _Event;
    if (!event) return nullptr;
    event->m_IsManual = manualReset;
    event->m_IsSignalled = initialState;
    return event;
}

void DeleteEvent(_Event* event) {
    NoKill noKill;
    delete event;
}

void SetEvent(_Event* event) {
    NoKill noKill;
    if (const void* sleeper = SetEventQuietly(event)) FutexWake(sleeper, 1);
}

const void* SetEventQuietly(_Event* event) {
    if (!event) return nullptr;
    NoKill noKill;
    const void* word = &event->m_Lock.Word();
    event->m_Lock.Obtain();
    SetLocked(*event);
    return event->m_Lock.ReleaseQuietly() ? word : nullptr;
}

void ResetEvent(_Event* event) {
    if (!event) return;
    NoKill noKill;
    event->m_Lock.Obtain();
    event->m_IsSignalled = false;
    event->m_Lock.Release();
}

void PulseEvent(_Event* event) {
    SetEvent(event);
    ResetEvent(event);
}

bool WaitEvent(_Event* event, unsigned int timeoutMs) {
    if (!event) return false;
    NoKill noKill;
    if (timeoutMs == 0) {
        if (!event->m_Lock.TryObtain()) return false;
    } else {
        event->m_Lock.Obtain();
        if (!event->m_IsSignalled) SleepUntilSet(*event, timeoutMs);
    }
    bool isSignalled = event->m_IsSignalled;
    if (!event->m_IsManual) event->m_IsSignalled = false;
    event->m_Lock.Release();
    return isSignalled;
}

bool WaitAllEvents(unsigned int count, _Event** events, unsigned int timeoutMs) {
    for (unsigned int i = 0; i < count; i++) {
        if (!WaitEvent(events[i], timeoutMs)) return false;
    }
    return true;
}

}  // namespace Korvel::Platform

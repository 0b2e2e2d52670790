// Events on a mutex and a futex word.
//
// The C library's condition variables keep books on their waiters in user space, which a waiter
// that is killed leaves wrong: others then lose wake-ups and the destruction waits for ever. Here
// the system's queue is the only book, and a killed thread leaves that by itself.
#include "Platform/Events.h"

#include <climits>
#include <mutex>

#include "Platform/ThreadInternal.h"

namespace Korvel::Platform {

struct _Event : Reuser {
    std::mutex m_Mutex;  // only held under NoKill, and never for long

    // Waiters sleep on it while the flag is clear; changed under the mutex whenever the flag gets
    // set.
    FutexWord m_Sequence{0};

    // Guarded by m_Mutex
    uint32_t m_WaiterCount = 0;  // a killed waiter stays counted, which costs idle wake-ups alone
    bool m_IsManual = false;
    bool m_IsSignalled = false;
};

namespace {

timespec DeadlineIn(unsigned int timeoutMs) {
    timespec time;
    clock_gettime(CLOCK_REALTIME, &time);
    constexpr uint64_t kSecond = 1'000'000'000;
    uint64_t ns = static_cast<uint64_t>(time.tv_sec) * kSecond +
                  static_cast<uint64_t>(time.tv_nsec) + uint64_t{timeoutMs} * 1'000'000;
    time.tv_sec = static_cast<time_t>(ns / kSecond);
    time.tv_nsec = static_cast<long>(ns % kSecond);
    return time;
}

// Wakes under the mutex: a waiter must not return, and perhaps delete the event, before we are done
// with it. A flag that is set already has woken whom it could.
void SetLocked(_Event& event) {
    if (event.m_IsSignalled) return;
    event.m_IsSignalled = true;
    event.m_Sequence.fetch_add(1, std::memory_order_relaxed);
    if (event.m_WaiterCount) FutexWake(&event.m_Sequence, event.m_IsManual ? INT_MAX : 1);
}

// Sleeps until the flag is set, the time is over or the system refuses. The mutex is held before
// and after, and the caller is inside of one NoKill guard.
void SleepUntilSet(_Event& event, unsigned int timeoutMs) {
    timespec deadline;
    bool hasLimit = timeoutMs != kNoTimeLimit;
    if (hasLimit) deadline = DeadlineIn(timeoutMs);
    event.m_WaiterCount++;
    int error = 0;
    while (!event.m_IsSignalled && (error == 0 || error == EAGAIN || error == EINTR)) {
        uint32_t seen = event.m_Sequence.load(std::memory_order_relaxed);
        event.m_Mutex.unlock();
        {
            KillableSleep sleep(&event.m_Sequence);
            error = FutexWait(event.m_Sequence, seen, hasLimit ? &deadline : nullptr);
        }
        event.m_Mutex.lock();
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
    if (!event) return;
    NoKill noKill;
    std::lock_guard lock(event->m_Mutex);
    SetLocked(*event);
}

void ResetEvent(_Event* event) {
    if (!event) return;
    NoKill noKill;
    std::lock_guard lock(event->m_Mutex);
    event->m_IsSignalled = false;
}

void PulseEvent(_Event* event) {
    SetEvent(event);
    ResetEvent(event);
}

bool WaitEvent(_Event* event, unsigned int timeoutMs) {
    if (!event) return false;
    NoKill noKill;
    std::unique_lock lock(event->m_Mutex, std::defer_lock);
    if (timeoutMs == 0) {
        if (!lock.try_lock()) return false;
    } else {
        lock.lock();
        if (!event->m_IsSignalled) SleepUntilSet(*event, timeoutMs);
    }
    bool isSignalled = event->m_IsSignalled;
    if (!event->m_IsManual) event->m_IsSignalled = false;
    return isSignalled;
}

bool WaitAllEvents(unsigned int count, _Event** events, unsigned int timeoutMs) {
    for (unsigned int i = 0; i < count; i++) {
        if (!WaitEvent(events[i], timeoutMs)) return false;
    }
    return true;
}

}  // namespace Korvel::Platform

#pragma once

#include <linux/futex.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <ctime>

namespace Korvel::Platform {

// A word that threads of this process sleep on until somebody changes it and wakes them.
using FutexWord = std::atomic<uint32_t>;

static_assert(sizeof(FutexWord) == sizeof(uint32_t) && FutexWord::is_always_lock_free);

// Sleeps if `word` still is `seen`.
//   deadline  on the wall clock; null has no limit
//   returns   0 when woken, else the system's error: ETIMEDOUT, EINTR, or EAGAIN when the word had
//             changed
inline int FutexWait(FutexWord& word, uint32_t seen, const timespec* deadline = nullptr) {
    constexpr int kWait = FUTEX_WAIT_BITSET | FUTEX_PRIVATE_FLAG | FUTEX_CLOCK_REALTIME;
    long result = syscall(SYS_futex, &word, kWait, seen, deadline, nullptr, FUTEX_BITSET_MATCH_ANY);
    return result == 0 ? 0 : errno;
}

// The same with a deadline on the clock that nobody sets.
inline int FutexWaitSteady(FutexWord& word, uint32_t seen, const timespec* deadline) {
    constexpr int kWait = FUTEX_WAIT_BITSET | FUTEX_PRIVATE_FLAG;
    long result = syscall(SYS_futex, &word, kWait, seen, deadline, nullptr, FUTEX_BITSET_MATCH_ANY);
    return result == 0 ? 0 : errno;
}

// Wakes at most `count` threads. It only uses the address, so the word may be gone already.
inline void FutexWake(const void* word, int count) {
    syscall(SYS_futex, word, FUTEX_WAKE_PRIVATE, count, nullptr, nullptr, 0);
}

// Moves at most `count` sleepers from `from`, which must still be `seen`, to `to`, where they sleep
// on. Returns how many it moved.
inline long FutexRequeue(FutexWord& from, uint32_t seen, FutexWord& to, long count) {
    return syscall(SYS_futex, &from, FUTEX_CMP_REQUEUE_PRIVATE, 0, count, &to, seen);
}

// A mutex on one futex word. It is taken and let go under NoKill; what holds it for longer, and
// what waits for it without a NoKill of its own, is up to its users.
class FutexLock {
public:
    bool TryObtain() {
        uint32_t free = kFree;
        return m_Word.compare_exchange_strong(free, kHeld, std::memory_order_acquire);
    }
    void Obtain() {
        if (!TryObtain()) ObtainAmongWaiters();
    }
    // For a thread that others may follow in the queue of the word, such as one that has slept
    // there.
    void ObtainAmongWaiters() {
        while (!TryObtainAmongWaiters()) AwaitRelease();
    }
    // The two steps of the same. Nothing happens to the lock while a thread awaits.
    bool TryObtainAmongWaiters() {
        return m_Word.exchange(kHeldWithWaiters, std::memory_order_acquire) == kFree;
    }
    void AwaitRelease() { FutexWait(m_Word, kHeldWithWaiters); }

    // Moves sleepers of another word here; whoever holds the lock calls it. They run one by one, as
    // the lock gets free, and not before.
    void TakeSleepers(FutexWord& from, uint32_t seen, long count) {
        if (FutexRequeue(from, seen, m_Word, count) > 0) {
            m_Word.store(kHeldWithWaiters, std::memory_order_relaxed);
        }
    }

    // The first part of Release: true when a FutexWake of one sleeper on Word() has to follow. The
    // lock may be gone by then.
    [[nodiscard]] bool ReleaseQuietly() {
        return m_Word.exchange(kFree, std::memory_order_release) == kHeldWithWaiters;
    }
    void Release() {
        if (ReleaseQuietly()) FutexWake(&m_Word, 1);
    }

    const FutexWord& Word() const { return m_Word; }

private:
    static constexpr uint32_t kFree = 0;
    static constexpr uint32_t kHeld = 1;
    static constexpr uint32_t kHeldWithWaiters = 2;

    FutexWord m_Word{kFree};
};

}  // namespace Korvel::Platform

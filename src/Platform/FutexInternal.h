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
//   returns   0 when woken, else the system's error: ETIMEDOUT, EAGAIN (the word had changed),
//   EINTR
inline int FutexWait(FutexWord& word, uint32_t seen, const timespec* deadline = nullptr) {
    constexpr int kWait = FUTEX_WAIT_BITSET | FUTEX_PRIVATE_FLAG | FUTEX_CLOCK_REALTIME;
    long result = syscall(SYS_futex, &word, kWait, seen, deadline, nullptr, FUTEX_BITSET_MATCH_ANY);
    return result == 0 ? 0 : errno;
}

// Wakes at most `count` threads. It only uses the address, so the word may be gone already.
inline void FutexWake(const void* word, int count) {
    syscall(SYS_futex, word, FUTEX_WAKE_PRIVATE, count, nullptr, nullptr, 0);
}

}  // namespace Korvel::Platform

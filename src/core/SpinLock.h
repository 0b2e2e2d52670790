#pragma once

#include <sched.h>

#include <atomic>
#include <cstdint>

#include "core/Export.h"

namespace Korvel {

// One wait of a spinning thread: call Step() between two looks at the contended word. It eases the
// processor's load, and after 1000 steps in a row it lets other threads run.
class SpinWait {
public:
    void Step() {
#if defined(__x86_64__) || defined(__i386__)
        __builtin_ia32_pause();
#endif
        if (++m_Steps >= 1000) {
            sched_yield();
            m_Steps = 0;
        }
    }

private:
    unsigned m_Steps = 0;
};

// A lock for a handful of instructions. It does not nest, and it is constant-initialised, so it
// works before the first static initialiser has run.
class SpinLock {
public:
    void Obtain() {
        SpinWait wait;
        while (m_Busy.exchange(true, std::memory_order_acquire)) {
            while (m_Busy.load(std::memory_order_relaxed)) wait.Step();
        }
    }
    void Release() { m_Busy.store(false, std::memory_order_release); }

private:
    std::atomic<bool> m_Busy{false};
};

// Holds a SpinLock until the end of its scope.
class AutoSpinLock {
public:
    explicit AutoSpinLock(SpinLock& lock) : m_Lock(lock) { m_Lock.Obtain(); }
    AutoSpinLock(const AutoSpinLock&) = delete;
    AutoSpinLock& operator=(const AutoSpinLock&) = delete;
    ~AutoSpinLock() { m_Lock.Release(); }

private:
    SpinLock& m_Lock;
};

// A spin lock that its holder may take again, and lets go as often. It is constant-initialised.
//
// For short stretches: no wait, no callback and no last Recycle inside. The holder cannot be
// killed: a kill that comes meanwhile takes effect where the outermost level is let go.
class KORVEL_EXPORT NestedSpinLock {
public:
    void ObtainLock();
    void ReleaseLock();  // by the thread that has it

private:
    std::atomic<uint64_t> m_Owner{0};  // the holder's thread id; 0 when free
    uint32_t m_Count = 0;              // guarded by the lock itself
};

// Holds a NestedSpinLock until the end of its scope.
class AutoNestedSpinLock {
public:
    explicit AutoNestedSpinLock(NestedSpinLock& lock) : m_Lock(lock) { m_Lock.ObtainLock(); }
    AutoNestedSpinLock(const AutoNestedSpinLock&) = delete;
    AutoNestedSpinLock& operator=(const AutoNestedSpinLock&) = delete;
    ~AutoNestedSpinLock() { m_Lock.ReleaseLock(); }

private:
    NestedSpinLock& m_Lock;
};

}  // namespace Korvel

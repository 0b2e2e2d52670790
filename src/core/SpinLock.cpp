#include "core/SpinLock.h"

#include <cassert>

#include "Platform/NoKillInternal.h"
#include "Platform/Threads.h"
#include "core/SpinLockInternal.h"

namespace Korvel {

void NestedSpinLock::ObtainLock() {
    using Platform::AddNoKillDepth;
    LockPlace::AssertMoreMayCome();
    uint64_t self = Platform::GetCurrentThreadID();
    AddNoKillDepth(1);  // until ReleaseLock
    if (m_Owner.load(std::memory_order_relaxed) != self) {
        SpinWait wait;
        for (uint64_t free = 0;
             !m_Owner.compare_exchange_weak(free, self, std::memory_order_acquire); free = 0) {
            // Who only waits may be killed.
            AddNoKillDepth(-1);
            do {
                wait.Step();
            } while (m_Owner.load(std::memory_order_relaxed) != 0);
            AddNoKillDepth(1);
        }
    }
    m_Count++;
}

void NestedSpinLock::ReleaseLock() {
    assert(m_Owner.load(std::memory_order_relaxed) == Platform::GetCurrentThreadID());
    if (--m_Count == 0) m_Owner.store(0, std::memory_order_release);
    Platform::AddNoKillDepth(-1);
}

}  // namespace Korvel

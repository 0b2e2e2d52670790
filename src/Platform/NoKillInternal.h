#pragma once

#include <atomic>

namespace Korvel::Platform {

// How many NoKill guards the current thread is inside of. The handler of KillThread's signal reads
// it, so it lives in the static thread block, which a signal handler may touch.
inline constinit thread_local int t_NoKillDepth __attribute__((tls_model("initial-exec"))) = 0;

// Set by that handler when it comes inside of a guard: the kill is due where the last guard ends. A
// thread that spends its time waiting inside of guards would otherwise hardly ever be caught
// outside.
inline constinit thread_local bool t_IsKillDue __attribute__((tls_model("initial-exec"))) = false;

// Ends the thread, unless the kill that was due has been given up.
void TakeDueKill();

inline void AddNoKillDepth(int change) {
    std::atomic_signal_fence(std::memory_order_seq_cst);
    t_NoKillDepth = t_NoKillDepth + change;
    std::atomic_signal_fence(std::memory_order_seq_cst);
    if (t_IsKillDue && t_NoKillDepth == 0) [[unlikely]]
        TakeDueKill();
}

// While one of these is in scope the current thread cannot be killed: a kill takes effect at the
// end of the scope. It brackets short stretches of code that leave shared data whole only at their
// end, never a wait without a limit and never a call into a host or a script.
class NoKill {
public:
    NoKill() { AddNoKillDepth(1); }
    NoKill(const NoKill&) = delete;
    NoKill& operator=(const NoKill&) = delete;
    ~NoKill() { AddNoKillDepth(-1); }
};

}  // namespace Korvel::Platform

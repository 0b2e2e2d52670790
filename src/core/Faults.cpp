#include "core/FaultsInternal.h"

#ifdef KORVEL_FAULTS

#include <atomic>

namespace Korvel::Faults {
namespace {

constinit std::atomic<bool> s_Armed{false};
constinit std::atomic<bool> s_ForGood{false};
constinit std::atomic<unsigned> s_Target{0};
constinit std::atomic<unsigned> s_Count{0};
constinit thread_local unsigned t_UncountedDepth = 0;

}  // namespace

void FailAt(unsigned n, bool forGood) {
    s_Count = 0;
    s_Target = n;
    s_ForGood = forGood;
    s_Armed = true;
}

unsigned Stop() {
    s_Armed = false;
    return s_Count;
}

bool ShouldFail() {
    if (!s_Armed.load(std::memory_order_relaxed) || t_UncountedDepth) return false;
    unsigned count = ++s_Count;
    return count == s_Target || (s_ForGood && count > s_Target);
}

Uncounted::Uncounted() {
    t_UncountedDepth++;
}
Uncounted::~Uncounted() {
    t_UncountedDepth--;
}

}  // namespace Korvel::Faults

#endif

#pragma once

// Failing allocations for tests. A build with KORVEL_FAULTS counts every allocation of the process
// that goes through the pools (and, where a test program wraps it, through malloc) and lets the one
// that a test has chosen fail. Other builds carry none of it.

namespace Korvel::Faults {

#ifdef KORVEL_FAULTS
// Lets the n-th allocation from here on fail, counted from 1; with `forGood` all that follow, too.
void FailAt(unsigned n, bool forGood);

// Ends the experiment. Returns how many allocations were asked for since FailAt.
unsigned Stop();

// Counts one allocation; true when it has to fail.
bool ShouldFail();

// While one is in scope the thread's allocations are not counted: the pools count a block when it
// is asked for, wherever it comes from.
struct Uncounted {
    Uncounted();
    ~Uncounted();
};
#else
constexpr bool ShouldFail() {
    return false;
}
struct Uncounted {
    Uncounted() {}  // not trivial, or it would be an unused variable
};
#endif

}  // namespace Korvel::Faults

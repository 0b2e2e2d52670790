#pragma once

#include "core/Export.h"

namespace Korvel::Platform {

// Milliseconds of the wall clock since 1970. It jumps when somebody sets the clock.
KORVEL_EXPORT unsigned long long GetUpTime();

// Sleeps for `ms` milliseconds, but never longer than 4294967 of them.
KORVEL_EXPORT void Wait(unsigned long long ms);

// A counter that only ever grows, and its ticks per second.
KORVEL_EXPORT unsigned long long GetTimeCount();
KORVEL_EXPORT unsigned long long GetTimeFreq();

}  // namespace Korvel::Platform

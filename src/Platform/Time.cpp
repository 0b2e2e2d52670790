#include "Platform/Time.h"

#include <algorithm>
#include <cerrno>

#include "Platform/TimeInternal.h"

namespace Korvel::Platform {

namespace {

constexpr unsigned long long kLongestWaitMs = 4294967;  // 32 bits of microseconds

}  // namespace

unsigned long long GetUpTime() {
    return ReadClock(CLOCK_REALTIME) / kMillisecondNs;
}

void Wait(unsigned long long ms) {
    // Up to a point in time, so that signals do not stretch the sleep.
    timespec until = ToTimespec(GetTimeCount() + std::min(ms, kLongestWaitMs) * kMillisecondNs);
    while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &until, nullptr) == EINTR) {
    }
}

unsigned long long GetTimeCount() {
    return ReadClock(CLOCK_MONOTONIC);
}

unsigned long long GetTimeFreq() {
    return kSecondNs;
}

}  // namespace Korvel::Platform

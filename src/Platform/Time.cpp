#include "Platform/Time.h"

#include <algorithm>
#include <cerrno>
#include <ctime>

namespace Korvel::Platform {

namespace {

constexpr unsigned long long kLongestWaitMs = 4294967;  // 32 bits of microseconds
constexpr unsigned long long kSecondNs = 1'000'000'000;

}  // namespace

unsigned long long GetUpTime() {
    timespec time;
    clock_gettime(CLOCK_REALTIME, &time);
    return static_cast<unsigned long long>(time.tv_sec) * 1000 +
           static_cast<unsigned long long>(time.tv_nsec) / 1'000'000;
}

void Wait(unsigned long long ms) {
    // Up to a point in time, so that signals do not stretch the sleep.
    unsigned long long until = GetTimeCount() + std::min(ms, kLongestWaitMs) * 1'000'000;
    timespec time{static_cast<time_t>(until / kSecondNs), static_cast<long>(until % kSecondNs)};
    while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &time, nullptr) == EINTR) {
    }
}

unsigned long long GetTimeCount() {
    timespec time;
    clock_gettime(CLOCK_MONOTONIC, &time);
    return static_cast<unsigned long long>(time.tv_sec) * kSecondNs +
           static_cast<unsigned long long>(time.tv_nsec);
}

unsigned long long GetTimeFreq() {
    return kSecondNs;
}

}  // namespace Korvel::Platform

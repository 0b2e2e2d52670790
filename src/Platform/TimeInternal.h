#pragma once

#include <cstdint>
#include <ctime>

namespace Korvel::Platform {

constexpr uint64_t kSecondNs = 1'000'000'000;
constexpr uint64_t kMillisecondNs = 1'000'000;

// The nanoseconds that a clock of the system shows, and the way back.
inline uint64_t ReadClock(clockid_t clock) {
    timespec time;
    clock_gettime(clock, &time);
    return static_cast<uint64_t>(time.tv_sec) * kSecondNs + static_cast<uint64_t>(time.tv_nsec);
}
inline timespec ToTimespec(uint64_t ns) {
    return {static_cast<time_t>(ns / kSecondNs), static_cast<long>(ns % kSecondNs)};
}

}  // namespace Korvel::Platform

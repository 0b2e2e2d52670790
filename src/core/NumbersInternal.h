#pragma once

#include <cstddef>
#include <cstdint>
#include <limits>

namespace Korvel {

// Numbers of scripts as integers, defined for every double: cut off toward zero, the nearest end of
// the range beyond it, and 0 for what is no number.
inline long long ToInt64(double number) {
    using Limits = std::numeric_limits<long long>;
    constexpr double kEnd = 9223372036854775808.0;  // 2^63, the first that does not fit
    if (number >= kEnd) return Limits::max();
    if (number >= -kEnd) return static_cast<long long>(number);
    return number < -kEnd ? Limits::min() : 0;  // NaN is below nothing
}

// The low 32 bits of that.
inline uint32_t Low32(double number) {
    return static_cast<uint32_t>(ToInt64(number));
}

// What the texts of numbers need at most.
constexpr size_t kNumberTextSize = 40;

// Writes a number with 6 or 15 significant digits, byte by byte what printf writes for "%g" and
// "%.15g" in the "C" locale, but without the NUL. Returns the end of the text; `out` needs
// kNumberTextSize bytes.
char* WriteFloat(char* out, double number);
char* WriteDouble(char* out, double number);

}  // namespace Korvel

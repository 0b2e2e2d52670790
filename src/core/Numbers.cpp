#include <bit>
#include <charconv>
#include <cmath>
#include <cstring>

#include "core/NumbersInternal.h"

namespace Korvel {
namespace {

constexpr int kFractionBits = 52;

// 10^0 to 10^19.
struct Powers {
    constexpr Powers() {
        uint64_t power = 1;
        for (uint64_t& p : m_Whole) {
            p = power;
            power *= 10;
        }
    }
    uint64_t m_Whole[20]{};
};
constexpr Powers kPowers;

// 10^-4 to 10^15: each is at least the power it stands for, and its predecessor is less.
constexpr double kBounds[] = {1e-4, 1e-3, 1e-2, 1e-1, 1e0,  1e1,  1e2,  1e3,  1e4,  1e5,
                              1e6,  1e7,  1e8,  1e9,  1e10, 1e11, 1e12, 1e13, 1e14, 1e15};

// The k for which 10^k <= number < 10^(k+1), for what lies between the first and last bound.
int DecimalExponent(double number) {
    int binary = static_cast<int>(std::bit_cast<uint64_t>(number) >> kFractionBits) - 1023;
    int exponent = (binary * 1233) >> 12;  // times log10(2): right, or one too low
    if (exponent < -4) exponent = -4;
    return number >= kBounds[exponent + 5] ? exponent + 1 : exponent;
}

// The number times 10^shift, rounded half to even as printf rounds. The product is exact; the shift
// is 0 to 18, and the number has places behind the point.
uint64_t ScaleAndRound(double number, int shift) {
    uint64_t bits = std::bit_cast<uint64_t>(number);
    uint64_t mantissa = (bits & ((uint64_t{1} << kFractionBits) - 1)) | uint64_t{1}
                                                                            << kFractionBits;
    int places = 1023 + kFractionBits - static_cast<int>(bits >> kFractionBits);
    using Wide = unsigned __int128;
    Wide product = Wide{mantissa} * kPowers.m_Whole[shift];
    Wide whole = product >> places;
    Wide rest = product - (whole << places);
    Wide half = Wide{1} << (places - 1);
    bool isUp = rest > half || (rest == half && (whole & 1) != 0);
    return static_cast<uint64_t>(whole) + isUp;
}

char* Append(char* out, const char* from, size_t length) {
    memcpy(out, from, length);
    return out + length;
}

// Writes the digits of a number below 10^`Digits` that lies between the bounds; `exponent` is that
// of the first digit.
char* Place(char* out, const char* digits, int count, int exponent) {
    while (count > exponent + 1 && count > 1 && digits[count - 1] == '0') count--;
    if (exponent < 0) {
        out = Append(out, "0.000", static_cast<size_t>(1 - exponent));
        return Append(out, digits, static_cast<size_t>(count));
    }
    int whole = exponent + 1;
    out = Append(out, digits, static_cast<size_t>(whole));
    if (count == whole) return out;
    *out++ = '.';
    return Append(out, digits + whole, static_cast<size_t>(count - whole));
}

template <int Digits>
char* Write(char* out, double number) {
    constexpr double kEnd = kBounds[Digits + 4];
    if (number > -kEnd && number < kEnd) {
        long long whole = static_cast<long long>(number);
        if (static_cast<double>(whole) == number && (whole != 0 || !std::signbit(number))) {
            return std::to_chars(out, out + kNumberTextSize, whole).ptr;
        }
    }
    double size = std::fabs(number);
    if (size >= kBounds[0] && size < kEnd) {
        int exponent = DecimalExponent(size);
        uint64_t rounded = ScaleAndRound(size, Digits - 1 - exponent);
        if (rounded == kPowers.m_Whole[Digits]) {
            rounded /= 10;
            exponent++;
        }
        if (exponent < Digits) {
            char digits[24];
            std::to_chars(digits, digits + sizeof digits, rounded);
            if (number < 0) *out++ = '-';
            return Place(out, digits, Digits, exponent);
        }
    }
    return std::to_chars(out, out + kNumberTextSize, number, std::chars_format::general, Digits)
        .ptr;
}

}  // namespace

char* WriteFloat(char* out, double number) {
    return Write<6>(out, number);
}

char* WriteDouble(char* out, double number) {
    return Write<15>(out, number);
}

}  // namespace Korvel

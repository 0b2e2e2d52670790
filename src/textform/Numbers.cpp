#include "textform/Numbers.h"

#include <algorithm>
#include <charconv>
#include <clocale>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "textform/Chars.h"

namespace Korvel::TextForm {

namespace {

// What is out of the range of doubles becomes infinite or 0, by the magnitude of its first digit.
double GetLimit(std::string_view text, bool isHex) {
    size_t mark = std::min(text.find_first_of(isHex ? "pP" : "eE"), text.size());
    std::string_view digits = text.substr(0, mark);
    auto point = static_cast<double>(std::min(digits.find('.'), digits.size()));
    auto first = static_cast<double>(std::min(digits.find_first_not_of("0."), digits.size()));
    double magnitude = (point - first) * (isHex ? 4 : 1);
    if (mark < text.size()) {
        std::string_view exponent = text.substr(mark + 1);
        bool negative = exponent[0] == '-';
        double value = 0;
        for (char c : exponent) {
            if (IsDigit(c)) value = value * 10 + (c - '0');
        }
        magnitude += negative ? -value : value;
    }
    return magnitude > 0 ? HUGE_VAL : 0;
}

}  // namespace

bool ReadNumberText(std::string_view text, double& number) {
    text = text.substr(0, text.find('\0'));
    while (!text.empty() && IsSpace(static_cast<unsigned char>(text.front()))) {
        text.remove_prefix(1);
    }
    while (!text.empty() && IsSpace(static_cast<unsigned char>(text.back()))) {
        text.remove_suffix(1);
    }
    bool negative = !text.empty() && text[0] == '-';
    if (!text.empty() && (negative || text[0] == '+')) text.remove_prefix(1);
    bool isHex = text.size() > 2 && text[0] == '0' && (text[1] | 0x20) == 'x';
    if (isHex) text.remove_prefix(2);
    if (text.empty() || text[0] == '-') return false;
    double value = 0;
    auto [end, error] =
        std::from_chars(text.data(), text.data() + text.size(), value,
                        isHex ? std::chars_format::hex : std::chars_format::general);
    if (error == std::errc::invalid_argument || end != text.data() + text.size()) return false;
    if (isHex && IsLetter(static_cast<unsigned char>(text[0])) &&
        !IsHexDigit(static_cast<unsigned char>(text[0]))) {
        return false;  // "0xinf"
    }
    if (error == std::errc::result_out_of_range) value = GetLimit(text, isHex);
    number = negative ? -value : value;
    return true;
}

size_t WriteNumber(char* buffer, double number) {
    // Whole numbers are the most common, and need no rounding below the fifteenth digit.
    if (number > -1e14 && number < 1e14) {
        auto whole = static_cast<int64_t>(number);
        if (static_cast<double>(whole) == number && (whole || !std::signbit(number))) {
            char* end = std::to_chars(buffer, buffer + kNumberSize, whole).ptr;
            *end = 0;
            return end - buffer;
        }
    }
    char* end =
        std::to_chars(buffer, buffer + kNumberSize, number, std::chars_format::general, 14).ptr;
    *end = 0;
    return end - buffer;
}

void GetChunkId(char* buffer, size_t size, const char* chunkName) {
    if (*chunkName == '=') {
        snprintf(buffer, size, "%s", chunkName + 1);
        return;
    }
    if (*chunkName == '@') {
        chunkName++;
        size_t room = size - sizeof " '...' ";
        size_t length = strlen(chunkName);
        const char* dots = length > room ? "..." : "";
        if (length > room) chunkName += length - room;
        snprintf(buffer, size, "%s%s", dots, chunkName);
        return;
    }
    size_t room = size - sizeof " [string \"...\"] ";
    size_t length = strcspn(chunkName, "\n\r");
    bool isCut = chunkName[length] != 0 || length > room;
    if (length > room) length = room;
    snprintf(buffer, size, "[string \"%.*s%s\"]", static_cast<int>(length), chunkName,
             isCut ? "..." : "");
}

}  // namespace Korvel::TextForm

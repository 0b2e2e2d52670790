// Classes of characters, those of ASCII whatever the locale.
#pragma once

namespace Korvel::TextForm {

inline constexpr bool IsDigit(int c) {
    return c >= '0' && c <= '9';
}
inline constexpr bool IsLower(int c) {
    return c >= 'a' && c <= 'z';
}
inline constexpr bool IsUpper(int c) {
    return c >= 'A' && c <= 'Z';
}
inline constexpr bool IsLetter(int c) {
    return IsLower(c | 0x20) && c < 0x80 && c > 0;
}
inline constexpr bool IsWordChar(int c) {
    return IsLetter(c) || IsDigit(c) || c == '_';
}
inline constexpr bool IsAlphanumeric(int c) {
    return IsLetter(c) || IsDigit(c);
}
inline constexpr bool IsHexDigit(int c) {
    return IsDigit(c) || ((c | 0x20) >= 'a' && (c | 0x20) <= 'f' && c > 0);
}
inline constexpr bool IsSpace(int c) {
    return c == ' ' || (c >= '\t' && c <= '\r');
}
inline constexpr bool IsControl(int c) {
    return (c >= 0 && c < 32) || c == 127;
}
inline constexpr bool IsPunctuation(int c) {
    return c > 32 && c < 127 && !IsAlphanumeric(c);
}
inline constexpr int ToLower(int c) {
    return IsUpper(c) ? c + 32 : c;
}
inline constexpr int ToUpper(int c) {
    return IsLower(c) ? c - 32 : c;
}

}  // namespace Korvel::TextForm

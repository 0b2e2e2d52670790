#pragma once

#include <strings.h>

#include <algorithm>
#include <cctype>
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <cwctype>

namespace Korvel {

class TagList;

// The C library's text functions under one name for all widths. What it lacks for char32_t it does
// as wchar_t, which is as wide; only the order and the case of char32_t are our own.
namespace Units {

inline const wchar_t* AsWide(const char32_t* text) {
    return reinterpret_cast<const wchar_t*>(text);
}
inline const char32_t* AsUCS4(const wchar_t* text) {
    return reinterpret_cast<const char32_t*>(text);
}

inline size_t Length(const char* text) {
    return strlen(text);
}
inline size_t Length(const wchar_t* text) {
    return wcslen(text);
}
inline size_t Length(const char32_t* text) {
    return wcslen(AsWide(text));
}
inline size_t Length(const unsigned short* text) {
    const unsigned short* end = text;
    while (*end) end++;
    return static_cast<size_t>(end - text);
}

// The same, up to `most` units.
inline size_t Length(const char* text, size_t most) {
    return strnlen(text, most);
}
inline size_t Length(const wchar_t* text, size_t most) {
    return wcsnlen(text, most);
}
inline size_t Length(const char32_t* text, size_t most) {
    return wcsnlen(AsWide(text), most);
}

// Searches. Null when there is nothing; NUL is found at the end.
inline const char* Find(const char* text, char c) {
    return strchr(text, c);
}
inline const wchar_t* Find(const wchar_t* text, wchar_t c) {
    return wcschr(text, c);
}
inline const char32_t* Find(const char32_t* text, char32_t c) {
    return AsUCS4(wcschr(AsWide(text), static_cast<wchar_t>(c)));
}

inline const char* Find(const char* text, const char* part) {
    return strstr(text, part);
}
inline const wchar_t* Find(const wchar_t* text, const wchar_t* part) {
    return wcsstr(text, part);
}
inline const char32_t* Find(const char32_t* text, const char32_t* part) {
    return AsUCS4(wcsstr(AsWide(text), AsWide(part)));
}

inline const char* FindOneOf(const char* text, const char* set) {
    return strpbrk(text, set);
}
inline const wchar_t* FindOneOf(const wchar_t* text, const wchar_t* set) {
    return wcspbrk(text, set);
}
inline const char32_t* FindOneOf(const char32_t* text, const char32_t* set) {
    return AsUCS4(wcspbrk(AsWide(text), AsWide(set)));
}

inline int Compare(const char* a, const char* b) {
    return strcmp(a, b);
}
inline int Compare(const wchar_t* a, const wchar_t* b) {
    return wcscmp(a, b);
}
inline int Compare(const char32_t* a, const char32_t* b) {
    while (*a && *a == *b) a++, b++;
    return (*a < *b) - (*a > *b);
}

inline int Collate(const char* a, const char* b) {
    return strcoll(a, b);
}
inline int Collate(const wchar_t* a, const wchar_t* b) {
    return wcscoll(a, b);
}
inline int Collate(const char32_t* a, const char32_t* b) {
    return Compare(a, b);
}

inline char32_t FoldAsciiCase(char32_t c) {
    return c >= 'A' && c <= 'Z' ? c + ('a' - 'A') : c;
}

// At most `most` units are compared.
inline int CompareNoCase(const char* a, const char* b, size_t most) {
    return strncasecmp(a, b, most);
}
inline int CompareNoCase(const wchar_t* a, const wchar_t* b, size_t most) {
    return wcsncasecmp(a, b, most);
}
inline int CompareNoCase(const char32_t* a, const char32_t* b, size_t most) {
    for (; most > 0; most--, a++, b++) {
        char32_t left = FoldAsciiCase(*a);
        char32_t right = FoldAsciiCase(*b);
        if (left != right) {
            int64_t difference = int64_t{left} - int64_t{right};
            return static_cast<int>(std::clamp<int64_t>(difference, -INT_MAX, INT_MAX));
        }
        if (!left) break;
    }
    return 0;
}

inline int CompareNoCase(const char* a, const char* b) {
    return strcasecmp(a, b);
}
inline int CompareNoCase(const wchar_t* a, const wchar_t* b) {
    return wcscasecmp(a, b);
}
inline int CompareNoCase(const char32_t* a, const char32_t* b) {
    return CompareNoCase(a, b, SIZE_MAX);
}

inline const char* FindNoCase(const char* text, const char* part) {
    return strcasestr(text, part);
}
template <class T>
const T* FindNoCase(const T* text, const T* part) {
    size_t length = Length(part);
    for (; CompareNoCase(text, part, length) != 0; text++) {
        if (!*text) return nullptr;
    }
    return text;
}

inline long ToNumber(const char* text, char** end) {
    return strtol(text, end, 10);
}
inline long ToNumber(const wchar_t* text, wchar_t** end) {
    return wcstol(text, end, 10);
}

// What the C library's tests for bytes (which do not take negative ones) and for wide characters
// (which take any) have in common. Below 128 all tests agree.
inline int AsByte(char c) {
    return static_cast<unsigned char>(c);
}
template <class T>
wint_t AsCode(T c) {
    return static_cast<wint_t>(c);
}

inline bool IsSpace(char c) {
    return isspace(AsByte(c)) != 0;
}
inline bool IsLower(char c) {
    return islower(AsByte(c)) != 0;
}
inline bool IsUpper(char c) {
    return isupper(AsByte(c)) != 0;
}
inline char ToLower(char c) {
    return static_cast<char>(tolower(AsByte(c)));
}
inline char ToUpper(char c) {
    return static_cast<char>(toupper(AsByte(c)));
}

template <class T>
bool IsSpace(T c) {
    return iswspace(AsCode(c)) != 0;
}
template <class T>
bool IsLower(T c) {
    return iswlower(AsCode(c)) != 0;
}
template <class T>
bool IsUpper(T c) {
    return iswupper(AsCode(c)) != 0;
}
template <class T>
T ToLower(T c) {
    return static_cast<T>(towlower(AsCode(c)));
}
template <class T>
T ToUpper(T c) {
    return static_cast<T>(towupper(AsCode(c)));
}

}  // namespace Units

void StripName(char32_t* dst, const char32_t* src, TagList* tags);

}  // namespace Korvel

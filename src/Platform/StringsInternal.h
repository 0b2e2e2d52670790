#pragma once

#include <concepts>
#include <cstddef>

#include "Platform/Strings.h"
#include "core/OxStringInternal.h"

namespace Korvel::Platform {

// The bytes that the first `length` code points take in UTF-8, terminator not counted. A code point
// that UTF-8 cannot hold counts as the longest.
size_t UTF8Length(const wchar_t* text, size_t length);
size_t UTF8Length(const char32_t* text, size_t length);

// The conversions under one name.
inline int ConvertUnits(const char* in, wchar_t* out, int size) {
    return UTF8ToWChar(in, out, size);
}
inline int ConvertUnits(const char* in, char32_t* out, int size) {
    return UTF8ToUCS4(in, out, size);
}
inline int ConvertUnits(const wchar_t* in, char* out, int size) {
    return WCharToUTF8(in, out, size);
}
inline int ConvertUnits(const wchar_t* in, char32_t* out, int size) {
    return WCharToUCS4(in, out, size);
}
inline int ConvertUnits(const char32_t* in, char* out, int size) {
    return UCS4ToUTF8(in, out, size);
}
inline int ConvertUnits(const char32_t* in, wchar_t* out, int size) {
    return UCS4ToWChar(in, out, size);
}
inline int ConvertUnits(const unsigned short* in, char* out, int size) {
    return UTF16ToUTF8(in, out, size);
}
inline int ConvertUnits(const unsigned short* in, wchar_t* out, int size) {
    return UTF16ToWChar(in, out, size);
}
inline int ConvertUnits(const unsigned short* in, char32_t* out, int size) {
    return UTF16ToWChar(in, reinterpret_cast<wchar_t*>(out), size);
}

// The units of T that a text comes to, if it can be converted.
template <class T>
size_t LengthIn(const char* text) {
    return static_cast<size_t>(utf8strlen(text));
}

template <class T, class Wide>
size_t LengthIn(const Wide* text) {
    size_t length = Units::Length(text);
    if constexpr (std::same_as<T, char>) {
        return UTF8Length(text, length);
    } else {
        return length;
    }
}

template <class T>
size_t LengthIn(const unsigned short* text) {
    size_t length = 0;
    for (; *text; text++) {
        if constexpr (std::same_as<T, char>) {
            bool isSurrogate = *text >= 0xD800 && *text < 0xE000;  // two of them make four bytes
            length += *text < 0x80 ? 1 : *text < 0x800 || isSurrogate ? 2 : 3;
        } else {
            length += *text < 0xDC00 || *text >= 0xE000;  // the second one of a pair is no more
        }
    }
    return length;
}

}  // namespace Korvel::Platform

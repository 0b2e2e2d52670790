#pragma once

#include <cstdarg>

#include "core/Export.h"

namespace Korvel::Platform {

// Conversions between the encodings of text. "ANSI" text is UTF-8, wchar_t holds UCS-4, UTF-16
// units are in the machine's order. UTF-8 and UCS-4 go up to 0x7FFFFFFF, in up to 6 bytes; UTF-16
// reaches 0x10FFFF. None of them looks at the locale.
//
// All conversions work alike:
//   in       a terminated text; null is an error
//   out      takes the result and its terminator, never more than `size` units; null only asks for
//            a size that is sure to suffice
//   size     the room at `out`, in units of the output
//   returns  the units written (or needed), terminator included; 0 on failure: text that is not
//            valid or has no counterpart, too little room, a result past INT_MAX. What then stands
//            at `out` is not a text.
KORVEL_EXPORT int UCS4ToUTF8(const char32_t* in, char* out, int size);
KORVEL_EXPORT int WCharToUTF8(const wchar_t* in, char* out, int size);
KORVEL_EXPORT int WCharToANSI(const wchar_t* in, char* out, int size);

// These three stop at the first byte that is not valid UTF-8, and then return the count of units so
// far, with no terminator: IsWholeText tells the one from the other.
KORVEL_EXPORT int UTF8ToUCS4(const char* in, char32_t* out, int size);
KORVEL_EXPORT int UTF8ToWChar(const char* in, wchar_t* out, int size);
KORVEL_EXPORT int ANSIToWChar(const char* in, wchar_t* out, int size);

KORVEL_EXPORT int WCharToUCS4(const wchar_t* in, char32_t* out, int size);
KORVEL_EXPORT int UCS4ToWChar(const char32_t* in, wchar_t* out, int size);

// An unpaired surrogate is an error.
KORVEL_EXPORT int UTF16ToUTF8(const unsigned short* in, char* out, int size);
KORVEL_EXPORT int UTF8ToUTF16(const char* in, unsigned short* out, int size);
KORVEL_EXPORT int WCharToUTF16(const wchar_t* in, unsigned short* out, int size);
KORVEL_EXPORT int UTF16ToWChar(const unsigned short* in, wchar_t* out, int size);

// True when a conversion that returned `written` has reached the end of its source.
template <class Unit>
bool IsWholeText(const Unit* out, int written) {
    return written > 0 && out[written - 1] == 0;
}

// The bytes of a text that begin a character: its length in code points, if it is valid. A null
// text has none.
KORVEL_EXPORT int utf8strlen(const char* text);

// True when the text's bytes form sequences of 1 to 4 bytes; overlong forms pass. So do an empty
// text and null.
KORVEL_EXPORT bool IsUTF8(const char* text);

// The length that a formatted text would have, terminator not counted; negative when it cannot be
// formatted, which the wide form says of every text past 32,768 characters too. The arguments are
// left as they were.
KORVEL_EXPORT KORVEL_PRINTF(1, 0) int _vscprintf(const char* format, va_list args);
KORVEL_EXPORT int _vscwprintf(const wchar_t* format, va_list args);

}  // namespace Korvel::Platform

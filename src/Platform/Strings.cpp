#include "Platform/Strings.h"

#include <iconv.h>

#include <algorithm>
#include <bit>
#include <climits>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <cwchar>

#include "Platform/NoKillInternal.h"
#include "Platform/StringsInternal.h"
#include "core/0ReusePool.h"

namespace Korvel::Platform {
namespace {

constexpr size_t kBlock = 8;  // characters that the short path for ASCII takes at once
constexpr ptrdiff_t kBlockSteps = kBlock;
constexpr uint64_t kHighBits = 0x8080808080808080;

// The first code point of each length of sequence, by the number of trail bytes.
constexpr uint32_t kFirstCode[] = {0, 0x80, 0x800, 0x10000, 0x200000, 0x4000000};

int ToResult(size_t units) {
    return units > INT_MAX ? 0 : static_cast<int>(units);
}

bool IsAsciiBlock(const unsigned char* text) {
    uint64_t bytes;
    memcpy(&bytes, text, kBlock);
    return (bytes & kHighBits) == 0;
}

template <class Wide>
bool IsAsciiBlock(const Wide* text) {
    uint32_t bits = 0;
    for (size_t i = 0; i < kBlock; i++) bits |= static_cast<uint32_t>(text[i]);
    return bits < 0x80;
}

int TrailBytes(uint32_t code) {
    if (code < kFirstCode[2]) return 1;
    int trail = 2;
    while (trail < 5 && code >= kFirstCode[trail + 1]) trail++;
    return trail;
}

// Writes a code point from 0x80 up as a lead byte and `trail` others.
void PutSequence(char* out, uint32_t code, int trail) {
    for (int i = trail; i > 0; i--) {
        out[i] = static_cast<char>(0x80 | (code & 0x3F));
        code >>= 6;
    }
    uint32_t lengthBits = 0xFFFFFF80u >> trail;  // one for every byte, at the top of the lead byte
    out[0] = static_cast<char>(lengthBits | code);
}

// Reads the sequence at `in`, whose first byte is not ASCII, and moves behind it. Returns false
// when it is not valid. The terminator is no trail byte, so nothing behind it is read.
bool TakeSequence(const unsigned char*& in, uint32_t& code) {
    unsigned lead = *in;
    if (lead < 0xC2 || lead > 0xFD) return false;
    if (lead < 0xE0) {  // most of them
        code = (lead & 0x1F) << 6 | (in[1] & 0x3Fu);
        bool isValid = (in[1] & 0xC0) == 0x80;
        in += isValid ? 2 : 0;
        return isValid;
    }
    int trail = std::countl_one(static_cast<unsigned char>(lead)) - 1;
    code = lead & (0x3Fu >> trail);
    for (int i = 1; i <= trail; i++) {
        if ((in[i] & 0xC0) != 0x80) return false;
        code = code << 6 | (in[i] & 0x3Fu);
    }
    if (code < kFirstCode[trail]) return false;  // overlong
    in += trail + 1;
    return true;
}

template <class Wide>
int Encode(const Wide* in, char* out, int size) {
    if (!in) return 0;
    size_t length = Units::Length(in);
    if (!out) return ToResult(6 * length + 1);
    const Wide* inEnd = in + length;
    char* p = out;
    ptrdiff_t room = static_cast<ptrdiff_t>(size) - 1;  // the terminator's place is set aside
    if (room < 0) return 0;
    char* end = out + room;
    while (in < inEnd) {
        while (inEnd - in >= kBlockSteps && end - p >= kBlockSteps && IsAsciiBlock(in)) {
            for (size_t i = 0; i < kBlock; i++) p[i] = static_cast<char>(in[i]);
            in += kBlock;
            p += kBlock;
        }
        for (; in < inEnd && static_cast<uint32_t>(*in) < 0x80; in++) {
            if (p == end) return 0;
            *p++ = static_cast<char>(*in);
        }
        if (in == inEnd) break;
        uint32_t code = static_cast<uint32_t>(*in);
        if (code > 0x7FFFFFFF) return 0;
        int trail = TrailBytes(code);
        if (end - p <= trail) return 0;
        PutSequence(p, code, trail);
        p += trail + 1;
        in++;
    }
    *p = '\0';
    return static_cast<int>(p - out) + 1;
}

template <class Wide>
int Decode(const char* text, Wide* out, int size) {
    if (!text) return 0;
    size_t length = Units::Length(text);
    if (!out) return ToResult(length + 1);
    auto in = reinterpret_cast<const unsigned char*>(text);
    const unsigned char* inEnd = in + length;
    Wide* p = out;
    Wide* end = out + std::max(size, 0);
    for (;;) {
        while (inEnd - in >= kBlockSteps && end - p >= kBlockSteps && IsAsciiBlock(in)) {
            for (size_t i = 0; i < kBlock; i++) p[i] = static_cast<Wide>(in[i]);
            in += kBlock;
            p += kBlock;
        }
        for (; *in < 0x80; in++) {
            if (p == end) return 0;
            *p++ = static_cast<Wide>(*in);
            if (in == inEnd) return static_cast<int>(p - out);
        }
        // Runs of these are usual, too.
        while (*in >= 0x80) {
            uint32_t code;
            if (p == end) return 0;
            if (!TakeSequence(in, code)) return static_cast<int>(p - out);
            *p++ = static_cast<Wide>(code);
        }
    }
}

template <class From, class To>
int Copy(const From* in, To* out, int size) {
    static_assert(sizeof(From) == sizeof(To));
    if (!in) return 0;
    size_t units = Units::Length(in) + 1;
    if (!out || units > INT_MAX) return ToResult(units);
    if (size < static_cast<int>(units)) return 0;
    memcpy(out, in, units * sizeof(To));
    return static_cast<int>(units);
}

template <class Wide>
size_t CountUTF8(const Wide* text, size_t length) {
    size_t bytes = length;
    for (size_t i = 0; i < length; i++) {
        uint32_t code = static_cast<uint32_t>(text[i]);
        for (int trail = 1; trail <= 5; trail++) bytes += code >= kFirstCode[trail];
    }
    return bytes;
}

// One direction of the conversions that the system does for us. Opening it costs thousands of
// times a short conversion, so every thread keeps its own until it ends.
class Converter {
public:
    constexpr Converter(const char* to, const char* from) : m_To(to), m_From(from) {}
    Converter(const Converter&) = delete;
    Converter& operator=(const Converter&) = delete;
    ~Converter() {
        NoKill noKill;
        if (m_Handle) iconv_close(m_Handle);
        m_Handle = nullptr;  // a destructor that runs later in this thread may convert text, too
    }

    // Follows the protocol of all conversions. No unit of `in` becomes more than `unitsForOne`.
    template <class In, class Out>
    int Convert(const In* in, Out* out, int size, size_t unitsForOne) {
        if (!in) return 0;
        size_t length = Units::Length(in);
        if (!out) return ToResult(length * unitsForOne + 1);
        if (size <= 0 || !Prepare()) return 0;
        char* from = reinterpret_cast<char*>(const_cast<In*>(in));
        size_t fromBytes = (length + 1) * sizeof(In);
        char* to = reinterpret_cast<char*>(out);
        size_t room = static_cast<size_t>(size) * sizeof(Out);
        size_t toBytes = room;
        if (iconv(m_Handle, &from, &fromBytes, &to, &toBytes) != 0) return 0;
        return static_cast<int>((room - toBytes) / sizeof(Out));
    }

private:
    bool Prepare() {
        NoKill noKill;
        if (m_Handle) {
            iconv(m_Handle, nullptr, nullptr, nullptr, nullptr);
            return true;
        }
        iconv_t handle = iconv_open(m_To, m_From);
        if (handle == reinterpret_cast<iconv_t>(-1)) return false;
        m_Handle = handle;
        return true;
    }

    const char* m_To;
    const char* m_From;
    iconv_t m_Handle = nullptr;
};

constexpr const char* kUTF8 = "utf-8";
constexpr const char* kUTF16 = std::endian::native == std::endian::little ? "utf-16le" : "utf-16be";
constexpr const char* kWide = "WCHAR_T";

constinit thread_local Converter t_UTF16ToUTF8(kUTF8, kUTF16);
constinit thread_local Converter t_UTF8ToUTF16(kUTF16, kUTF8);
constinit thread_local Converter t_WCharToUTF16(kUTF16, kWide);
constinit thread_local Converter t_UTF16ToWChar(kWide, kUTF16);

}  // namespace

int UCS4ToUTF8(const char32_t* in, char* out, int size) {
    return Encode(in, out, size);
}
int WCharToUTF8(const wchar_t* in, char* out, int size) {
    return Encode(in, out, size);
}
int WCharToANSI(const wchar_t* in, char* out, int size) {
    return Encode(in, out, size);
}

int UTF8ToUCS4(const char* in, char32_t* out, int size) {
    return Decode(in, out, size);
}
int UTF8ToWChar(const char* in, wchar_t* out, int size) {
    return Decode(in, out, size);
}
int ANSIToWChar(const char* in, wchar_t* out, int size) {
    return Decode(in, out, size);
}

int WCharToUCS4(const wchar_t* in, char32_t* out, int size) {
    return Copy(in, out, size);
}
int UCS4ToWChar(const char32_t* in, wchar_t* out, int size) {
    return Copy(in, out, size);
}

int UTF16ToUTF8(const unsigned short* in, char* out, int size) {
    NoKill noKill;
    return t_UTF16ToUTF8.Convert(in, out, size, 3);
}

int UTF8ToUTF16(const char* in, unsigned short* out, int size) {
    NoKill noKill;
    return t_UTF8ToUTF16.Convert(in, out, size, 1);
}

int WCharToUTF16(const wchar_t* in, unsigned short* out, int size) {
    NoKill noKill;
    return t_WCharToUTF16.Convert(in, out, size, 2);
}

int UTF16ToWChar(const unsigned short* in, wchar_t* out, int size) {
    NoKill noKill;
    return t_UTF16ToWChar.Convert(in, out, size, 1);
}

size_t UTF8Length(const wchar_t* text, size_t length) {
    return CountUTF8(text, length);
}
size_t UTF8Length(const char32_t* text, size_t length) {
    return CountUTF8(text, length);
}

int utf8strlen(const char* text) {
    if (!text) return 0;
    size_t length = strlen(text);
    size_t count = 0;
    for (size_t i = 0; i < length; i++) count += static_cast<signed char>(text[i]) >= -0x40;
    return static_cast<int>(std::min<size_t>(count, INT_MAX));
}

bool IsUTF8(const char* text) {
    if (!text) return true;
    for (auto p = reinterpret_cast<const unsigned char*>(text); *p; p++) {
        unsigned lead = *p;
        if (lead < 0x80) continue;
        if (lead < 0xC0 || lead > 0xF7) return false;
        int trail = lead < 0xE0 ? 1 : lead < 0xF0 ? 2 : 3;
        for (; trail > 0; trail--) {
            if ((*++p & 0xC0) != 0x80) return false;
        }
    }
    return true;
}

int _vscprintf(const char* format, va_list args) {
    va_list copy;
    va_copy(copy, args);
    int length = format ? vsnprintf(nullptr, 0, format, copy) : -1;
    va_end(copy);
    return length;
}

int _vscwprintf(const wchar_t* format, va_list args) {
    constexpr size_t kFirstTrial = 512;
    constexpr size_t kLastTrial = 32768;
    if (!format) return -1;
    // vswprintf does not tell the length of what did not fit.
    wchar_t firstTrial[kFirstTrial + 1];
    wchar_t* trial = firstTrial;
    int length = -1;
    for (size_t room = kFirstTrial; room <= kLastTrial; room *= 2) {
        if (room > kFirstTrial) {
            void* memory = g_ReusePoolMgr.Alloc((room + 1) * sizeof(wchar_t));
            if (!memory) break;
            trial = static_cast<wchar_t*>(memory);
        }
        va_list copy;
        va_copy(copy, args);
        length = vswprintf(trial, room + 1, format, copy);
        va_end(copy);
        if (trial != firstTrial) g_ReusePoolMgr.Free(trial);
        if (length >= 0) break;
    }
    return length;
}

}  // namespace Korvel::Platform

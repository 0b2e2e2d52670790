// What needs to know characters: their groups, the symbols made of names, and the order of names.
#include <fribidi.h>

#include <algorithm>
#include <climits>
#include <cstring>

#include "Platform/Strings.h"
#include "core/0ReusePool.h"
#include "core/OxID.h"
#include "core/OxString.h"
#include "core/OxStringInternal.h"
#include "core/TextCellInternal.h"

namespace Korvel {
namespace {

FriBidiCharType TypeOf(uint32_t code) {
    return fribidi_get_bidi_type(code);
}

bool IsLetter(uint32_t code) {
    return FRIBIDI_IS_LETTER(TypeOf(code));
}

template <class Wide>
void StripWide(Wide* dst, const Wide* src) {
    if (!dst) return;
    Wide* out = dst;
    for (; src && *src; src++) {
        uint32_t code = static_cast<uint32_t>(*src);
        bool isDigit = code >= '0' && code <= '9';
        if (isDigit ? out != dst : code == '_' || IsLetter(code)) *out++ = *src;
    }
    *out = 0;
}

template <class T>
bool IsDigit(T c) {
    return c >= '0' && c <= '9';
}

template <class T>
int CompareSmart(const T* a, const T* b) {
    constexpr T kEmpty[1] = {};
    if (!a) a = kEmpty;
    if (!b) b = kEmpty;
    while (*a && *b && Units::CompareNoCase(a, b, 1) == 0) {
        a++, b++;
        if (!IsDigit(*a) || !IsDigit(*b)) continue;
        T* aEnd;
        T* bEnd;
        // Both are at digits, so neither is negative and the difference fits; too long a run of
        // digits counts as LONG_MAX.
        long difference = Units::ToNumber(a, &aEnd) - Units::ToNumber(b, &bEnd);
        if (difference) return static_cast<int>(std::clamp<long>(difference, -INT_MAX, INT_MAX));
        a = aEnd;
        b = bEnd;
    }
    return Units::CompareNoCase(a, b);
}

}  // namespace

CharGroups::CharGroups(const OxStringT<char32_t>& text)
    : m_Text(text), m_Count(0), m_Offsets(nullptr) {
    size_t length = static_cast<size_t>(text.GetLength());
    if (!length) return;
    m_Offsets = static_cast<int*>(g_ReusePoolMgr.Alloc((length + 1) * sizeof(int)));
    if (!m_Offsets) return;
    const char32_t* units = m_Text;
    for (size_t i = 0; i < length; i++) {
        if (TypeOf(units[i]) != FRIBIDI_TYPE_NSM) m_Offsets[m_Count++] = static_cast<int>(i);
    }
    m_Offsets[m_Count] = static_cast<int>(length);
}

CharGroups::~CharGroups() {
    g_ReusePoolMgr.Free(m_Offsets);
}

int stricoll_smart(const char* a, const char* b) {
    return CompareSmart(a, b);
}
int wcsicoll_smart(const wchar_t* a, const wchar_t* b) {
    return CompareSmart(a, b);
}

void StripName(wchar_t* dst, const wchar_t* src, TagList*) {
    StripWide(dst, src);
}
void StripName(char32_t* dst, const char32_t* src, TagList*) {
    StripWide(dst, src);
}

void StripName(char* dst, const char* src, TagList* tags) {
    if (!dst) return;
    constexpr size_t kScratch = 256;
    wchar_t scratch[kScratch];
    size_t length = src ? strlen(src) : 0;
    int size = length < INT_MAX ? static_cast<int>(length) + 1 : 0;
    wchar_t* wide = scratch;
    if (length >= kScratch) {
        wide = static_cast<wchar_t*>(g_ReusePoolMgr.Alloc((length + 1) * sizeof(wchar_t)));
    }
    bool stripped = wide && Platform::IsWholeText(wide, Platform::UTF8ToWChar(src, wide, size));
    if (stripped) {
        StripName(wide, wide, tags);
        Platform::WCharToUTF8(wide, dst, size);
    } else {
        *dst = '\0';
    }
    if (wide != scratch) g_ReusePoolMgr.Free(wide);
}

// The text may come from outside, and an identifier's must not begin with the marker of cells.
OxID::OxID(const OxStringT<char>& text) {
    if (!static_cast<const char*>(text)) return;
    size_t length = static_cast<size_t>(text.GetLength());
    char* cell = TextCell::New(length);
    if (!cell) return;
    memcpy(cell + 1, text, length);
    cell[1] = TextCell::SafeFirstByte(cell[1]);
    m_Text = cell;
}

void OxID::Strip() {
    if (!m_Text) return;
    OxStringT<char> text(*this);
    text.StripName();
    *this = OxID(text);
}

}  // namespace Korvel

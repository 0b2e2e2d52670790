#include "core/OxString.h"

#include <algorithm>
#include <cstdio>
#include <cstring>

#include "Platform/StringsInternal.h"
#include "core/0ReusePool.h"
#include "core/OxStringInternal.h"

namespace Korvel {
namespace {

constexpr int kLeft = 1;
constexpr int kRight = 2;

// Most formatted texts are shorter, and so are formatted once.
constexpr int kFormatScratch = 512;

// Source and target may overlap.
template <class T>
void Copy(T* target, const T* source, size_t length) {
    if (length && target != source) memmove(target, source, length * sizeof(T));
}

template <class T>
size_t LengthOf(const T* text) {
    return text ? Units::Length(text) : 0;
}

// Writes at most `size` units, NUL included. Returns the length of the whole text, negative when it
// cannot be formatted.
int FormatUnits(char* out, int size, const char* format, va_list args) {
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"  // the callers' callers have been checked
    return vsnprintf(out, static_cast<size_t>(size), format, args);
#pragma GCC diagnostic pop
}

int FormatUnits(wchar_t* out, int size, const wchar_t* format, va_list args) {
    va_list again;
    va_copy(again, args);
    int length = vswprintf(out, static_cast<size_t>(size), format, args);
    if (length < 0) length = Platform::_vscwprintf(format, again);
    va_end(again);
    return length;
}

int FormatUnits(char32_t* out, int size, const char32_t* format, va_list args) {
    return -1;
}

// Part `index` of a text, as begin and end; the last part when there are fewer.
template <class T>
std::pair<const T*, const T*> FindPart(const T* text, T separator, int index) {
    const T* next = Units::Find(text, separator);
    for (; index > 0 && next; index--) {
        text = next + 1;
        next = Units::Find(text, separator);
    }
    return {text, next ? next : text + Units::Length(text)};
}

// The words of a text, one after the other.
template <class T>
class WordReader {
public:
    WordReader(const T* text, size_t length) : m_Next(text), m_End(text + length) {
        SkipSpace();
        while (m_End > m_Next && Units::IsSpace(m_End[-1])) m_End--;
    }

    // Moves on to the next word. Returns false when there is none.
    bool Step() {
        if (m_Next == m_End) return false;
        m_Word = m_Next;
        m_WordEnd = m_Next = std::find(m_Next, m_End, static_cast<T>(' '));
        SkipSpace();
        return true;
    }
    const T* Word() const { return m_Word; }
    size_t WordLength() const { return static_cast<size_t>(m_WordEnd - m_Word); }

private:
    void SkipSpace() {
        while (m_Next < m_End && Units::IsSpace(*m_Next)) m_Next++;
    }

    const T* m_Next;
    const T* m_End;
    const T* m_Word = nullptr;
    const T* m_WordEnd = nullptr;
};

}  // namespace

template <class T>
constinit T OxStringT<T>::m_EmptyString[1] = {};

// ---- Buffers

// A fresh block with one holder. Null for a length that no string has, and without memory.
template <class T>
T* OxStringT<T>::NewBuffer(unsigned long length) {
    if (length > kMaxStringLength) return nullptr;
    void* memory = g_ReusePoolMgr.Alloc(sizeof(Header) + (length + 1) * sizeof(T));
    if (!memory) return nullptr;
    Header* header = new (memory) Header{1, static_cast<int32_t>(length), 0};
    T* buffer = reinterpret_cast<T*>(header + 1);
    buffer[0] = 0;
    return buffer;
}

template <class T>
void OxStringT<T>::Release(T* block) {
    std::atomic<int32_t>& uses = HeaderOf(block)->m_Uses;
    // A single holder has no one to race with, but must see what the others did before they left.
    if (uses.load(std::memory_order_acquire) == 1 ||
        uses.fetch_sub(1, std::memory_order_acq_rel) == 1) {
        g_ReusePoolMgr.Free(HeaderOf(block));
    }
}

template <class T>
T* OxStringT<T>::GetBuffer(unsigned long length) {
    if (HasBlock()) {
        Header* header = HeaderOf(m_Text);
        if (header->m_Uses.load(std::memory_order_acquire) < 2 &&
            static_cast<unsigned long>(header->m_Capacity) >= length) {
            header->m_Uses.store(2, std::memory_order_relaxed);
            return m_Text;
        }
    }
    return length ? NewBuffer(length) : m_EmptyString;
}

template <class T>
void OxStringT<T>::SetBuffer(T* buffer) {
    if (HasBlock()) {
        std::atomic<int32_t>& uses = HeaderOf(m_Text)->m_Uses;
        if (buffer == m_Text && uses.load(std::memory_order_relaxed) == 2) {
            uses.store(1, std::memory_order_relaxed);
        } else {
            Release(m_Text);
        }
    }
    m_Text = buffer ? buffer : m_EmptyString;
}

template <class T>
void OxStringT<T>::SetStringLength(T* buffer, int length) {
    if (!IsBlock(buffer)) return;
    buffer[length] = 0;
    HeaderOf(buffer)->m_Length = length;
}

// Takes over a buffer that has been filled; null, for one that could not be had, empties the
// string.
template <class T>
void OxStringT<T>::Adopt(T* buffer, unsigned long length) {
    SetStringLength(buffer, static_cast<int>(length));
    SetBuffer(buffer);
}

template <class T>
void OxStringT<T>::MakeUnique() {
    if (IsUnique()) return;
    unsigned long length = Length();
    T* buffer = NewBuffer(static_cast<unsigned long>(HeaderOf(m_Text)->m_Capacity));
    if (buffer) Copy(buffer, m_Text, length);
    Adopt(buffer, length);
}

template <class T>
T* OxStringT<T>::ObtainRaw(unsigned long length) {
    if (length) {
        unsigned long kept = std::min(length, Length());
        T* buffer = GetBuffer(length);
        if (buffer) Copy(buffer, m_Text, kept);
        Adopt(buffer, kept);
        return buffer;
    }
    bool hadText = !IsEmpty();
    MakeUnique();
    if (hadText && IsEmpty()) return nullptr;
    if (!m_Text) m_Text = m_EmptyString;
    return m_Text;
}

template <class T>
void OxStringT<T>::ReleaseRaw(unsigned long length) {
    if (!HasBlock()) return;
    unsigned long capacity = static_cast<unsigned long>(HeaderOf(m_Text)->m_Capacity);
    length = length ? std::min(length, capacity) : Units::Length(m_Text, capacity);
    SetStringLength(m_Text, static_cast<int>(length));
}

template <class T>
bool OxStringT<T>::IsValid() const {
    return !IsNull(this) && m_Text;
}

template <class T>
bool OxStringT<T>::IsUnique() const {
    return !HasBlock() || HeaderOf(m_Text)->m_Uses.load(std::memory_order_acquire) < 2;
}

template <class T>
void OxStringT<T>::Empty() {
    SetBuffer(m_EmptyString);
}

// True when `text` lies in this string's buffer, so that writing there changes it.
template <class T>
bool OxStringT<T>::Owns(const T* text) const {
    if (!HasBlock()) return false;
    uintptr_t offset = reinterpret_cast<uintptr_t>(text) - reinterpret_cast<uintptr_t>(m_Text);
    return offset / sizeof(T) <= static_cast<uintptr_t>(HeaderOf(m_Text)->m_Capacity);
}

// Puts `length` units in the place of the `removed` ones at `position`: what nearly every editing
// operation comes down to.
template <class T>
void OxStringT<T>::Splice(unsigned long position, unsigned long removed, const T* text,
                          unsigned long length) {
    unsigned long behind = position + removed;
    unsigned long tail = Length() - behind;
    unsigned long total = position + length + tail;
    bool movesText = tail && length != removed && Owns(text);
    T* buffer = movesText ? NewBuffer(total) : GetBuffer(total);
    if (buffer) {
        if (buffer != m_Text) Copy(buffer, m_Text, position);
        Copy(buffer + position + length, m_Text + behind, tail);
        Copy(buffer + position, text, length);
    }
    Adopt(buffer, total);
}

// Makes the string two texts in a row, from wherever they are.
template <class T>
void OxStringT<T>::Join(const T* a, unsigned long aLength, const T* b, unsigned long bLength) {
    unsigned long total = aLength + bLength;
    T* buffer = total ? NewBuffer(total) : nullptr;
    if (buffer) {
        Copy(buffer, a, aLength);
        Copy(buffer + aLength, b, bLength);
    }
    Adopt(buffer, total);
}

// ---- Setting

template <class T>
void OxStringT<T>::Set(const T* text) {
    Splice(0, Length(), text, LengthOf(text));
}

template <class T>
void OxStringT<T>::Set(const T* text, unsigned long length) {
    Splice(0, Length(), text, text ? Units::Length(text, length) : 0);
}

template <class T>
void OxStringT<T>::Set(const T* a, const T* b) {
    Join(a, LengthOf(a), b, LengthOf(b));
}

template <class T>
void OxStringT<T>::Set(const T* a, const OxStringT& b) {
    Join(a, LengthOf(a), b.m_Text, b.Length());
}

template <class T>
void OxStringT<T>::Set(const OxStringT& other) {
    T* text = other.Share();
    if (HasBlock()) Release(m_Text);
    m_Text = text;
}

template <class T>
void OxStringT<T>::Set(const OxStringT& other, unsigned long length) {
    if (length >= other.Length()) {
        Set(other);
    } else {
        Splice(0, Length(), other.m_Text, length);
    }
}

template <class T>
void OxStringT<T>::Set(const OxStringT& a, const T* b) {
    Join(a.m_Text, a.Length(), b, LengthOf(b));
}

template <class T>
void OxStringT<T>::Set(const OxStringT& a, const T* b, unsigned long bLength) {
    Join(a.m_Text, a.Length(), b, b ? Units::Length(b, bLength) : 0);
}

template <class T>
void OxStringT<T>::Set(const OxStringT& a, const OxStringT& b) {
    Join(a.m_Text, a.Length(), b.m_Text, b.Length());
}

template <class T>
void OxStringT<T>::Set(T c) {
    Set(&c, 1);
}

template <class T>
void OxStringT<T>::Set(OxStringT&& other) noexcept {
    T* text = std::exchange(other.m_Text, m_EmptyString);
    if (HasBlock()) Release(m_Text);
    m_Text = text;
}

template <class T>
OxStringT<T>& OxStringT<T>::operator+=(const T* text) {
    if (text && *text) Splice(Length(), 0, text, Units::Length(text));
    return *this;
}

template <class T>
OxStringT<T>& OxStringT<T>::operator+=(const OxStringT& text) {
    if (!text.IsEmpty()) Splice(Length(), 0, text.m_Text, text.Length());
    return *this;
}

template <class T>
OxStringT<T> OxStringT<T>::operator/(const T* name) const {
    if (!m_Text) return OxStringT(name);
    unsigned long length = Length();
    if (length && (m_Text[length - 1] == '/' || m_Text[length - 1] == '\\')) {
        return OxStringT(*this, name);
    }
    unsigned long nameLength = LengthOf(name);
    unsigned long total = length + 1 + nameLength;
    T* buffer = NewBuffer(total);
    if (buffer) {
        Copy(buffer, m_Text, length);
        buffer[length] = '/';
        Copy(buffer + length + 1, name, nameLength);
    }
    OxStringT result;
    result.Adopt(buffer, total);
    return result;
}

// ---- Comparison

template <class T>
bool OxStringT<T>::operator==(const T* text) const {
    return m_Text == text || Units::Compare(Text(), text ? text : m_EmptyString) == 0;
}

template <class T>
int OxStringT<T>::Compare(const T* text) const {
    return text ? Units::Compare(Text(), text) : !IsEmpty();
}

template <class T>
int OxStringT<T>::CompareNoCase(const T* text) const {
    return text ? Units::CompareNoCase(Text(), text) : !IsEmpty();
}

template <class T>
int OxStringT<T>::Collate(const T* text) const {
    return text ? Units::Collate(Text(), text) : !IsEmpty();
}

template <class T>
bool OxStringT<T>::BeginsWith(const T* text) const {
    unsigned long length = LengthOf(text);
    return length <= Length() && (!length || memcmp(m_Text, text, length * sizeof(T)) == 0);
}

template <class T>
bool OxStringT<T>::BeginsWithNoCase(const T* text) const {
    unsigned long length = LengthOf(text);
    return length <= Length() && (!length || Units::CompareNoCase(m_Text, text, length) == 0);
}

template <class T>
bool OxStringT<T>::EndsWith(const T* text) const {
    unsigned long length = LengthOf(text);
    return length <= Length() && (!length || Units::Compare(m_Text + Length() - length, text) == 0);
}

template <class T>
bool OxStringT<T>::EndsWithNoCase(const T* text) const {
    unsigned long length = LengthOf(text);
    return length <= Length() &&
           (!length || Units::CompareNoCase(m_Text + Length() - length, text) == 0);
}

// ---- Search

template <class T>
int OxStringT<T>::Find(T c, int start) const {
    if (start < 0 || start >= GetLength() || !c) return -1;
    const T* found = Units::Find(m_Text + start, c);
    return found ? static_cast<int>(found - m_Text) : -1;
}

template <class T>
int OxStringT<T>::Find(const T* text, int start) const {
    if (start < 0 || start >= GetLength() || !text) return -1;
    const T* found = Units::Find(m_Text + start, text);
    return found ? static_cast<int>(found - m_Text) : -1;
}

template <class T>
int OxStringT<T>::FindNoCase(const T* text, int start) const {
    if (start < 0 || start >= GetLength() || !text) return -1;
    const T* found = Units::FindNoCase(m_Text + start, text);
    return found ? static_cast<int>(found - m_Text) : -1;
}

template <class T>
int OxStringT<T>::FindOneOf(const T* set, int start) const {
    if (start < 0 || start >= GetLength() || !set) return -1;
    const T* found = Units::FindOneOf(m_Text + start, set);
    return found ? static_cast<int>(found - m_Text) : -1;
}

template <class T>
int OxStringT<T>::ReverseFind(T c, int start) const {
    if (start == -1) start = GetLength() - 1;
    if (start < 0 || start >= GetLength()) return -1;
    while (start >= 0 && m_Text[start] != c) start--;
    return start;
}

// ---- Extraction and trimming

template <class T>
OxStringT<T> OxStringT<T>::Left(int length) const {
    if (length < 0) length = std::max(GetLength() + length, 0);
    return OxStringT(*this, static_cast<unsigned long>(length));
}

template <class T>
OxStringT<T> OxStringT<T>::Mid(int start, int length) const {
    OxStringT result;
    start = std::max(start, 0);
    int rest = GetLength() - start;
    if (rest <= 0) return result;
    if (length < 0 || length > rest) length = rest;
    if (length == GetLength()) return *this;
    result.Splice(0, 0, m_Text + start, static_cast<unsigned long>(length));
    return result;
}

template <class T>
OxStringT<T> OxStringT<T>::Right(int length) const {
    return Mid(GetLength() - std::clamp(length, 0, GetLength()));
}

// Cuts off the units at the ends (kLeft, kRight or both) for which `test` is true.
template <class T>
template <class Test>
OxStringT<T>& OxStringT<T>::TrimIf(Test test, int sides) {
    unsigned long begin = 0;
    unsigned long end = Length();
    while ((sides & kLeft) && begin < end && test(m_Text[begin])) begin++;
    while ((sides & kRight) && begin < end && test(m_Text[end - 1])) end--;
    if (end - begin < Length()) Splice(0, Length(), m_Text + begin, end - begin);
    return *this;
}

template <class T>
OxStringT<T>& OxStringT<T>::Trim() {
    return TrimIf([](T c) { return Units::IsSpace(c); }, kLeft | kRight);
}

template <class T>
OxStringT<T>& OxStringT<T>::Trim(T c) {
    return TrimIf([c](T unit) { return unit == c; }, kLeft | kRight);
}

template <class T>
OxStringT<T>& OxStringT<T>::Trim(const T* set) {
    return set ? TrimIf([set](T c) { return Units::Find(set, c) != nullptr; }, kLeft | kRight)
               : *this;
}

template <class T>
OxStringT<T>& OxStringT<T>::TrimLeft() {
    return TrimIf([](T c) { return Units::IsSpace(c); }, kLeft);
}

template <class T>
OxStringT<T>& OxStringT<T>::TrimLeft(T c) {
    return TrimIf([c](T unit) { return unit == c; }, kLeft);
}

template <class T>
OxStringT<T>& OxStringT<T>::TrimLeft(const T* set) {
    return set ? TrimIf([set](T c) { return Units::Find(set, c) != nullptr; }, kLeft) : *this;
}

template <class T>
OxStringT<T>& OxStringT<T>::TrimRight() {
    return TrimIf([](T c) { return Units::IsSpace(c); }, kRight);
}

template <class T>
OxStringT<T>& OxStringT<T>::TrimRight(T c) {
    return TrimIf([c](T unit) { return unit == c; }, kRight);
}

template <class T>
OxStringT<T>& OxStringT<T>::TrimRight(const T* set) {
    return set ? TrimIf([set](T c) { return Units::Find(set, c) != nullptr; }, kRight) : *this;
}

template <class T>
OxStringT<T>& OxStringT<T>::TrimLength(int length) {
    if (length < 0) length = std::max(GetLength() + length, 0);
    if (length < GetLength()) Splice(0, Length(), m_Text, static_cast<unsigned long>(length));
    return *this;
}

// ---- Case and editing

template <class T>
bool OxStringT<T>::HasLower() const {
    return std::any_of(m_Text, m_Text + Length(), [](T c) { return Units::IsLower(c); });
}

template <class T>
bool OxStringT<T>::HasUpper() const {
    return std::any_of(m_Text, m_Text + Length(), [](T c) { return Units::IsUpper(c); });
}

template <class T>
void OxStringT<T>::MakeLower() {
    MakeUnique();
    std::transform(m_Text, m_Text + Length(), m_Text, [](T c) { return Units::ToLower(c); });
}

template <class T>
void OxStringT<T>::MakeUpper() {
    MakeUnique();
    std::transform(m_Text, m_Text + Length(), m_Text, [](T c) { return Units::ToUpper(c); });
}

template <class T>
int OxStringT<T>::Replace(T from, T to) {
    if (from == to || !to || Find(from) < 0) return 0;
    MakeUnique();
    int count = 0;
    for (T* p = m_Text; p < m_Text + Length(); p++) {
        if (*p != from) continue;
        *p = to;
        count++;
    }
    return count;
}

template <class T>
int OxStringT<T>::Replace(const T* from, const T* to) {
    if (!from || !*from || from == to) return 0;
    unsigned long fromLength = Units::Length(from);
    unsigned long toLength = LengthOf(to);
    unsigned long count = 0;
    for (const T* p = Text(); (p = Units::Find(p, from)); p += fromLength) count++;
    if (!count) return 0;
    if (toLength > kMaxStringLength) return Empty(), 0;

    unsigned long total = Length() - count * fromLength + count * toLength;
    // In place, writing does not overtake reading; a text in our own buffer runs to its end, where
    // writing arrives only after that text's last use.
    T* buffer = toLength <= fromLength ? GetBuffer(total) : NewBuffer(total);
    if (!buffer) return Empty(), 0;
    T* out = buffer;
    const T* rest = m_Text;
    const T* end = m_Text + Length();
    for (unsigned long i = 0; i < count; i++) {
        const T* found = Units::Find(rest, from);
        size_t between = static_cast<size_t>(found - rest);
        Copy(out, rest, between);
        Copy(out + between, to, toLength);
        out += between + toLength;
        rest = found + fromLength;
    }
    Copy(out, rest, static_cast<size_t>(end - rest));
    Adopt(buffer, total);
    return static_cast<int>(count);
}

template <class T>
int OxStringT<T>::Remove(T c) {
    if (Find(c) < 0) return 0;
    MakeUnique();
    int oldLength = GetLength();
    T* end = std::remove(m_Text, m_Text + oldLength, c);
    SetStringLength(m_Text, static_cast<int>(end - m_Text));
    return oldLength - GetLength();
}

template <class T>
void OxStringT<T>::Insert(int position, T c) {
    Insert(position, &c, 1);
}

template <class T>
void OxStringT<T>::Insert(int position, const T* text, int length) {
    if (!text || length < 1) return;
    unsigned long inserted = Units::Length(text, static_cast<size_t>(length));
    if (!inserted) return;
    if (position < 0 || position > GetLength()) position = GetLength();
    Splice(static_cast<unsigned long>(position), 0, text, inserted);
}

template <class T>
void OxStringT<T>::Delete(int position, int length) {
    position = std::max(position, 0);
    int rest = GetLength() - position;
    if (rest <= 0 || length == 0) return;
    if (length < 0 || length > rest) length = rest;
    Splice(static_cast<unsigned long>(position), static_cast<unsigned long>(length), nullptr, 0);
}

// ---- Formatting

// Keeps the first `kept` units and puts the formatted text in the place of the rest.
template <class T>
void OxStringT<T>::Format(unsigned long kept, const T* format, va_list args) {
    if (!format || std::same_as<T, char32_t>) return Empty();
    va_list again;
    va_copy(again, args);
    T scratch[kFormatScratch] = {};
    unsigned long length =
        static_cast<unsigned long>(std::max(FormatUnits(scratch, kFormatScratch, format, args), 0));
    // A NUL that is formatted as a character ends the text: no string holds one.
    if (length < kFormatScratch) {
        Splice(kept, Length() - kept, scratch, Units::Length(scratch, length));
    } else {
        // The arguments may be read out of the present buffer, so it must not be written.
        T* buffer = NewBuffer(kept + length);
        if (buffer) {
            Copy(buffer, m_Text, kept);
            FormatUnits(buffer + kept, static_cast<int>(length) + 1, format, again);
        }
        Adopt(buffer, buffer ? kept + Units::Length(buffer + kept, length) : 0);
    }
    va_end(again);
}

// The forms for char once more: those are declared as specialisations, so that they are checked.

template <>
void OxStringT<char>::PrintF(const char* format, ...) {
    va_list args;
    va_start(args, format);
    Format(0, format, args);
    va_end(args);
}

template <>
void OxStringT<char>::PrintFArgs(const char* format, va_list args) {
    Format(0, format, args);
}

template <>
void OxStringT<char>::CatF(const char* format, ...) {
    va_list args;
    va_start(args, format);
    Format(Length(), format, args);
    va_end(args);
}

template <>
void OxStringT<char>::CatFArgs(const char* format, va_list args) {
    Format(Length(), format, args);
}

template <class T>
void OxStringT<T>::PrintF(const T* format, ...) {
    va_list args;
    va_start(args, format);
    Format(0, format, args);
    va_end(args);
}

template <class T>
void OxStringT<T>::PrintFArgs(const T* format, va_list args) {
    Format(0, format, args);
}

template <class T>
void OxStringT<T>::CatF(const T* format, ...) {
    va_list args;
    va_start(args, format);
    Format(Length(), format, args);
    va_end(args);
}

template <class T>
void OxStringT<T>::CatFArgs(const T* format, va_list args) {
    Format(Length(), format, args);
}

// ---- Parts of the text

template <class T>
int OxStringT<T>::CountUnits(T c) const {
    return static_cast<int>(std::count(m_Text, m_Text + Length(), c));
}

template <class T>
int OxStringT<T>::CountParts(T separator) const {
    return IsEmpty() ? 0 : CountUnits(separator) + 1;
}

template <class T>
OxStringT<T> OxStringT<T>::GetLine(int index) const {
    auto [begin, end] = FindPart(Text(), static_cast<T>('\n'), index);
    if (*end && end > begin && end[-1] == '\r') end--;
    return Mid(static_cast<int>(begin - Text()), static_cast<int>(end - begin));
}

template <class T>
OxStringT<T> OxStringT<T>::GetTab(int index) const {
    auto [begin, end] = FindPart(Text(), static_cast<T>('\t'), index);
    return Mid(static_cast<int>(begin - Text()), static_cast<int>(end - begin));
}

template <class T>
int OxStringT<T>::GetWordCount() const {
    int count = 0;
    for (WordReader<T> words(m_Text, Length()); words.Step();) count++;
    return count;
}

template <class T>
OxStringT<T> OxStringT<T>::GetWord(int index) const {
    WordReader<T> words(m_Text, Length());
    while (words.Step() && index > 0) index--;
    if (!words.Word()) return OxStringT();
    return Mid(static_cast<int>(words.Word() - m_Text), static_cast<int>(words.WordLength()));
}

template <class T>
int OxStringT<T>::GetChar(int index) const {
    T c = Text()[index];
    if constexpr (std::same_as<T, char>) {
        return static_cast<signed char>(c);
    } else {
        return static_cast<int>(c);
    }
}

template <class T>
int OxStringT<T>::SpacesBeforeWord(int index) const {
    const T* p = Text();
    int blanks = 0;
    for (;; index--) {
        for (; *p == ' '; p++) blanks++;
        if (index <= 0 || !*p) return blanks;
        while (*p && *p != ' ') p++;
    }
}

// ---- Encodings

template <class T>
template <class U>
void OxStringT<T>::ConvertFrom(const U* text) {
    if constexpr (std::same_as<U, T>) {
        Set(text);
    } else {
        unsigned long length = text ? Platform::LengthIn<T>(text) : 0;
        T* buffer = length ? NewBuffer(length) : nullptr;
        int written =
            buffer ? Platform::ConvertUnits(text, buffer, static_cast<int>(length) + 1) : 0;
        if (buffer && !Platform::IsWholeText(buffer, written)) {
            Release(buffer);
            buffer = nullptr;
        }
        Adopt(buffer, buffer ? static_cast<unsigned long>(written) - 1 : 0);
    }
}

template <class T>
void OxStringT<T>::Convert(const char* text) {
    ConvertFrom(text);
}

template <class T>
void OxStringT<T>::Convert(const wchar_t* text) {
    ConvertFrom(text);
}

template <class T>
void OxStringT<T>::Convert(const char32_t* text) {
    ConvertFrom(text);
}

template <class T>
void OxStringT<T>::Convert(const unsigned short* text) {
    ConvertFrom(text);
}

template <class T>
OxStringT<char> OxStringT<T>::ToUTF8() const {
    return OxStringT<char>(*this);
}

template <class T>
OxStringT<wchar_t> OxStringT<T>::FromANSI() const requires ByteUnit<T> {
    return OxStringT<wchar_t>(*this);
}

template <class T>
OxStringT<wchar_t> OxStringT<T>::FromUTF8() const requires ByteUnit<T> {
    return OxStringT<wchar_t>(*this);
}

template <class T>
void OxStringT<T>::StripName() {
    MakeUnique();
    if (IsEmpty()) return;
    Korvel::StripName(m_Text, m_Text, nullptr);
    SetStringLength(m_Text, static_cast<int>(Units::Length(m_Text)));
}

bool KRIsValidAddress(const void* address, unsigned long size, bool write) {
    return address != nullptr;
}

template class OxStringT<char>;
template class OxStringT<wchar_t>;
template class OxStringT<char32_t>;

}  // namespace Korvel

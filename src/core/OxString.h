#pragma once

#include <atomic>
#include <concepts>
#include <cstdarg>
#include <cstdint>
#include <cstring>
#include <utility>

#include "core/Export.h"
#include "core/OxID.h"

namespace Korvel {

template <class T>
class KORVEL_EXPORT OxStringT;

template <class T>
concept ByteUnit = std::same_as<T, char>;

// The units whose text a string of T takes over by converting it; unsigned short is UTF-16.
template <class U, class T>
concept OtherUnit =
    !std::same_as<U, T> && (std::same_as<U, char> || std::same_as<U, wchar_t> ||
                            std::same_as<U, char32_t> || std::same_as<U, unsigned short>);

// The most units that a string can hold.
constexpr unsigned long kMaxStringLength = INT32_MAX - 1;

// Writes into a string's buffer until the end of its scope, then sets the string's length to what
// stands before the first NUL. Null where memory has run out.
template <class T>
class AutoOxStringRawT {
public:
    AutoOxStringRawT(OxStringT<T>& string, unsigned long length)
        : m_String(string), m_Raw(string.ObtainRaw(length)) {}
    AutoOxStringRawT(const AutoOxStringRawT&) = delete;
    AutoOxStringRawT& operator=(const AutoOxStringRawT&) = delete;
    ~AutoOxStringRawT() {
        if (m_Raw) m_String.ReleaseRaw(0);
    }

    operator T*() const { return m_Raw; }

private:
    OxStringT<T>& m_String;
    T* m_Raw;
};

// A string whose copies share one buffer until one of them is written. There is one for each of
// char (UTF-8), wchar_t and char32_t (both UCS-4).
//
// It is exactly one pointer, to NUL-terminated text, so it passes wherever a C string is wanted.
// Empty strings point at m_EmptyString; a null pointer is as good, everywhere. No string holds a
// NUL. Positions and lengths count units of T. A null text argument counts as an empty one, unless
// an operation says otherwise, and every text may lie in the string's own buffer.
//
// Buffers: a pool block with a count of holders. A new one has room for just what was asked, so
//          repeated appending copies each time. A string that is the only holder is edited in
//          place.
// Threads: strings that share a buffer may be used on several threads, one string on one thread.
// Failure: where memory has run out, or the result were longer than kMaxStringLength, the string
//          (or the one returned) is empty. So it is after a text that cannot be converted.
template <class T>
class KORVEL_EXPORT OxStringT {
public:
    // Construction. Every form has a Set of the same arguments, which replaces the text.

    constexpr OxStringT() noexcept : m_Text(m_EmptyString) {}
    OxStringT(const T* text) : OxStringT() { Set(text); }
    OxStringT(const T* text, unsigned long length) : OxStringT() { Set(text, length); }
    OxStringT(const T* a, const T* b) : OxStringT() { Set(a, b); }
    OxStringT(const T* a, const OxStringT& b) : OxStringT() { Set(a, b); }
    OxStringT(const OxStringT& other) noexcept : m_Text(other.Share()) {}
    OxStringT(const OxStringT& other, unsigned long length) : OxStringT() { Set(other, length); }
    OxStringT(const OxStringT& a, const T* b) : OxStringT() { Set(a, b); }
    OxStringT(const OxStringT& a, const T* b, unsigned long bLength) : OxStringT() {
        Set(a, b, bLength);
    }
    OxStringT(const OxStringT& a, const OxStringT& b) : OxStringT() { Set(a, b); }
    explicit OxStringT(T c) : OxStringT() { Set(c); }
    OxStringT(const OxID& id) requires ByteUnit<T> : OxStringT() {
        Set(static_cast<const char*>(id));
    }
    OxStringT(OxStringT&& other) noexcept : m_Text(std::exchange(other.m_Text, m_EmptyString)) {}
    template <OtherUnit<T> U>
    OxStringT(const U* text) : OxStringT() {
        Convert(text);
    }
    template <OtherUnit<T> U>
    OxStringT(const OxStringT<U>& text) : OxStringT() {
        Convert(static_cast<const U*>(text));
    }
    ~OxStringT() {
        if (HasBlock()) Release(m_Text);
    }

    void Set() { Empty(); }
    void Set(const T* text);
    void Set(const T* text, unsigned long length);  // at most `length` units, up to a NUL
    void Set(const T* a, const T* b);               // a then b
    void Set(const T* a, const OxStringT& b);
    void Set(const OxStringT& other);
    void Set(const OxStringT& other, unsigned long length);  // at most `length` units
    void Set(const OxStringT& a, const T* b);
    void Set(const OxStringT& a, const T* b, unsigned long bLength);
    void Set(const OxStringT& a, const OxStringT& b);
    void Set(T c);  // one unit; none for NUL
    void Set(const OxID& id) requires ByteUnit<T> { Set(static_cast<const char*>(id)); }
    void Set(OxStringT&& other) noexcept;
    template <OtherUnit<T> U>
    void Set(const U* text) {
        Convert(text);
    }
    template <OtherUnit<T> U>
    void Set(const OxStringT<U>& text) {
        Convert(static_cast<const U*>(text));
    }

    OxStringT& operator=(const T* text) { return Set(text), *this; }
    // NOLINTNEXTLINE(bugprone-unhandled-self-assignment): Set shares before it lets go
    OxStringT& operator=(const OxStringT& other) { return Set(other), *this; }
    OxStringT& operator=(OxStringT&& other) noexcept { return Set(std::move(other)), *this; }
    OxStringT& operator=(const OxID& id) requires ByteUnit<T> {
        return Set(static_cast<const char*>(id)), *this;
    }
    template <OtherUnit<T> U>
    OxStringT& operator=(const U* text) {
        return Set(text), *this;
    }
    template <OtherUnit<T> U>
    OxStringT& operator=(const OxStringT<U>& text) {
        return Set(text), *this;
    }

    // State.

    operator const T*() const { return m_Text; }
    int GetLength() const { return GetStringLength(m_Text); }
    bool IsEmpty() const { return GetLength() == 0; }
    bool IsValid() const;   // the object and its pointer are not null; the object may be
    bool IsUnique() const;  // no other string shares the buffer
    void Empty();           // lets go of the buffer

    // Raw access. A buffer has room for the units that were asked for and a NUL; the string's text
    // pointer may change, and no copy of the string may be made, until the access ends.

    // A buffer of this string alone with room for `length` units, holding the first `length` of its
    // text; 0 takes buffer and text as they are, which for an empty string leaves no room. Null,
    // and the string empty, where memory has run out.
    T* ObtainRaw(unsigned long length);
    // Ends the access: the text has `length` units, as far as there is room; 0 looks for the NUL.
    void ReleaseRaw(unsigned long length);
    AutoOxStringRawT<T> AutoRaw(unsigned long length) { return {*this, length}; }

    // The lower half of the same. GetBuffer gives the string's own buffer, if no other string holds
    // it and it is large enough, else a fresh one with nothing in it (m_EmptyString for length 0);
    // null where memory has run out. It must come back by SetBuffer, after SetStringLength.
    T* GetBuffer(unsigned long length);
    void SetBuffer(T* buffer);
    static int GetStringLength(const T* buffer) {
        return IsBlock(buffer) ? HeaderOf(buffer)->m_Length : 0;
    }
    static void SetStringLength(T* buffer, int length);  // writes the NUL, too
    void MakeUnique();                                   // stops sharing

    // Concatenation, and the joining of paths: one separator between the two, unless the first
    // ends in a slash or backslash. An empty first part gives a rooted path; a null one gives the
    // second part alone.

    OxStringT& operator+=(T c) { return Insert(-1, c), *this; }
    OxStringT& operator+=(const T* text);
    OxStringT& operator+=(const OxStringT& text);
    OxStringT& operator+=(const OxID& id) requires ByteUnit<T> {
        return *this += static_cast<const char*>(id);
    }
    template <OtherUnit<T> U>
    OxStringT& operator+=(const U* text) {
        return *this += OxStringT(text);
    }
    template <OtherUnit<T> U>
    OxStringT& operator+=(const OxStringT<U>& text) {
        return *this += OxStringT(text);
    }
    OxStringT operator+(T c) const { return OxStringT(*this, &c, 1); }
    OxStringT operator+(const T* text) const { return OxStringT(*this, text); }
    OxStringT operator+(const OxStringT& text) const { return OxStringT(*this, text); }
    OxStringT operator+(const OxID& id) const requires ByteUnit<T> {
        return *this + static_cast<const char*>(id);
    }
    template <OtherUnit<T> U>
    OxStringT operator+(const U* text) const {
        return OxStringT(*this, OxStringT(text));
    }
    template <OtherUnit<T> U>
    OxStringT operator+(const OxStringT<U>& text) const {
        return OxStringT(*this, OxStringT(text));
    }
    friend OxStringT operator+(const T* a, const OxStringT& b) { return OxStringT(a, b); }

    OxStringT operator/(const T* name) const;
    OxStringT operator/(const OxStringT& name) const { return *this / name.m_Text; }
    OxStringT& operator/=(const T* name) { return Set(*this / name), *this; }
    OxStringT& operator/=(const OxStringT& name) { return Set(*this / name), *this; }

    // Comparison: by the unit (Compare), without case, or in the order of the current locale, and
    // with the C library's signs. A null argument gives 0 for a null string, else whether the
    // string is not empty.
    //
    // char32_t differs: Compare, Collate, < and > put the larger unit first, Collate is Compare,
    // and only A to Z have a case.

    bool operator==(const T* text) const;  // null and empty are equal
    bool operator==(const OxStringT& other) const {
        unsigned long length = Length();
        return m_Text == other.m_Text ||
               (length == other.Length() && memcmp(Text(), other.Text(), length * sizeof(T)) == 0);
    }
    bool operator==(const OxID& id) const requires ByteUnit<T> {
        return *this == static_cast<const char*>(id);
    }
    bool operator<(const T* text) const { return Compare(text) < 0; }
    bool operator>(const T* text) const { return Compare(text) > 0; }
    int Compare(const T* text) const;
    int CompareNoCase(const T* text) const;
    int Collate(const T* text) const;
    int CollateNoCase(const T* text) const { return CompareNoCase(text); }

    // True for a null text.
    bool BeginsWith(const T* text) const;
    bool BeginsWithNoCase(const T* text) const;
    bool EndsWith(const T* text) const;
    bool EndsWithNoCase(const T* text) const;

    // Search. The position found, or -1; a start outside of the text gives -1, and so do null and
    // NUL. An empty text is found where the search starts.

    int Find(T c, int start = 0) const;
    int Find(const T* text, int start = 0) const;
    int FindNoCase(const T* text, int start = 0) const;
    int FindOneOf(const T* set, int start = 0) const;
    int ReverseFind(T c, int start = -1) const;  // backwards; -1 starts at the last unit

    // Extraction. A part that is the whole text shares the buffer.

    OxStringT Left(int length) const;  // negative: all but the last -length
    // A start below 0 counts as 0; a negative length runs to the end, as one too large does.
    OxStringT Mid(int start, int length = -1) const;
    OxStringT Right(int length) const;  // nothing for a negative length

    // Trimming in place: white space (of the current locale), one unit, or all units of a set.

    OxStringT& Trim();
    OxStringT& Trim(T c);
    OxStringT& Trim(const T* set);
    OxStringT& TrimLeft();
    OxStringT& TrimLeft(T c);
    OxStringT& TrimLeft(const T* set);
    OxStringT& TrimRight();
    OxStringT& TrimRight(T c);
    OxStringT& TrimRight(const T* set);
    OxStringT& TrimLength(int length);  // cuts to `length`; negative cuts off -length

    // Case, unit by unit in the current locale.

    bool HasLower() const;
    bool HasUpper() const;
    void MakeLower();
    void MakeUpper();

    // Editing. A string with nothing to replace or remove keeps sharing its buffer.

    int Replace(T from, T to);                // returns how many; 0 if either is NUL
    int Replace(const T* from, const T* to);  // the same; an empty `to` deletes
    int Remove(T c);                          // the same
    // A position of -1 or past the end appends. Does nothing when there is nothing to insert.
    void Insert(int position, T c);
    void Insert(int position, const T* text, int length = INT32_MAX);
    void Delete(int position, int length);  // negative length: to the end

    // Formatting, as printf (wprintf, which stops at 32,768 units) has it: PrintF replaces the text
    // and CatF adds to it; what cannot be formatted counts as empty text. A null format makes the
    // string empty. There is no formatting for char32_t; the string becomes empty.

    void PrintF(const T* format, ...);
    void PrintFArgs(const T* format, va_list args);
    void CatF(const T* format, ...);
    void CatFArgs(const T* format, va_list args);

    // Parts of the text, counted from 0; an index past the end gives the last part, a negative one
    // the first. Lines end in LF or CR LF and an empty text has none; words are divided by blanks,
    // together with the white space around those.

    int GetLineCount() const { return CountParts('\n'); }
    OxStringT GetLine(int index) const;
    int GetTabCount() const { return CountParts('\t'); }
    OxStringT GetTab(int index) const;
    int GetWordCount() const;
    OxStringT GetWord(int index) const;
    int GetCharCount() const { return GetLength(); }
    int GetChar(int index) const;  // unchecked; char is taken as signed
    // The blanks before a word, which here is any run of other units, or in the whole text.
    int SpacesBeforeWord(int index) const;
    int InterWordCount() const { return CountUnits(' '); }

    // Encodings. The From and To operations with an argument replace the text by the argument,
    // converted to T. "ANSI" and "UTF8" are the same.

    void ToANSI(const wchar_t* text) { Convert(text); }
    void ToANSI(const char32_t* text) { Convert(text); }
    void ToUTF8(const wchar_t* text) { Convert(text); }
    void ToUTF8(const char32_t* text) { Convert(text); }
    void ToUCS4(const char* text) { Convert(text); }
    void ToUCS4(const wchar_t* text) { Convert(text); }
    void FromANSI(const char* text) { Convert(text); }
    void FromUTF8(const char* text) { Convert(text); }
    void FromUTF16(const unsigned short* text) { Convert(text); }
    void FromUCS4(const char32_t* text) { Convert(text); }

    OxStringT<char> ToANSI() const { return ToUTF8(); }
    OxStringT<char> ToUTF8() const;
    OxStringT<wchar_t> FromANSI() const requires ByteUnit<T>;
    OxStringT<wchar_t> FromUTF8() const requires ByteUnit<T>;

    // Leaves what may stand in a symbol: see the function of this name.
    void StripName();

    // What empty strings point at. Nobody writes more to it than the NUL that stands there.
    static T m_EmptyString[1];

private:
    struct Header {
        std::atomic<int32_t> m_Uses;
        int32_t m_Capacity;  // units, without the NUL
        int32_t m_Length;
    };
    static_assert(sizeof(Header) == 12);

    static Header* HeaderOf(const T* buffer) {
        return reinterpret_cast<Header*>(const_cast<T*>(buffer)) - 1;
    }
    static bool IsBlock(const T* buffer) { return buffer && buffer != m_EmptyString; }
    bool HasBlock() const { return IsBlock(m_Text); }
    T* Share() const noexcept {
        if (HasBlock()) HeaderOf(m_Text)->m_Uses.fetch_add(1, std::memory_order_relaxed);
        return m_Text;
    }
    static T* NewBuffer(unsigned long length);
    static void Release(T* block);
    void Adopt(T* buffer, unsigned long length);

    const T* Text() const { return m_Text ? m_Text : m_EmptyString; }
    unsigned long Length() const { return static_cast<unsigned long>(GetLength()); }
    bool Owns(const T* text) const;
    void Splice(unsigned long position, unsigned long removed, const T* text, unsigned long length);
    void Join(const T* a, unsigned long aLength, const T* b, unsigned long bLength);
    void Format(unsigned long kept, const T* format, va_list args);

    // Replace the text by a text of this or another width.
    void Convert(const char* text);
    void Convert(const wchar_t* text);
    void Convert(const char32_t* text);
    void Convert(const unsigned short* text);
    template <class U>
    void ConvertFrom(const U* text);

    template <class Test>
    OxStringT& TrimIf(Test test, int sides);
    int CountUnits(T c) const;
    int CountParts(T separator) const;

    T* m_Text;
};

// These alone carry the checking of formats, which knows no wide ones.
template <>
KORVEL_PRINTF(2, 3)
void OxStringT<char>::PrintF(const char* format, ...);
template <>
KORVEL_PRINTF(2, 0)
void OxStringT<char>::PrintFArgs(const char* format, va_list args);
template <>
KORVEL_PRINTF(2, 3)
void OxStringT<char>::CatF(const char* format, ...);
template <>
KORVEL_PRINTF(2, 0)
void OxStringT<char>::CatFArgs(const char* format, va_list args);

extern template class OxStringT<char>;
extern template class OxStringT<wchar_t>;
extern template class OxStringT<char32_t>;

static_assert(sizeof(OxStringT<char>) == sizeof(char*));

// A text's base characters, each with the non-spacing marks that follow it. Marks that nothing
// comes before belong to no group.
//
// Group i runs from m_Offsets[i] to m_Offsets[i + 1]; there is one offset more than groups. Where
// memory has run out, there are no groups and m_Offsets is null, as for an empty text.
class KORVEL_EXPORT CharGroups {
public:
    explicit CharGroups(const OxStringT<char32_t>& text);
    CharGroups(const CharGroups&) = delete;
    CharGroups& operator=(const CharGroups&) = delete;
    ~CharGroups();

    OxStringT<char32_t> m_Text;
    int m_Count;
    int* m_Offsets;
};

// The order in which people expect names: without case, and numbers by their value, so that x10
// comes after x9. A number counts as one only behind an equal character: 10 comes before 9. Null
// texts are empty. The result's sign tells the order.
KORVEL_EXPORT int stricoll_smart(const char* a, const char* b);
KORVEL_EXPORT int wcsicoll_smart(const wchar_t* a, const wchar_t* b);

// Turns a name for people into a symbol: keeps letters of all scripts, `_`, and ASCII digits that
// something stands before. `dst` needs as much room as `src` takes, and may be the same. A text
// that is not valid leaves `dst` empty, as missing memory does. The list is not used.
KORVEL_EXPORT void StripName(char* dst, const char* src, TagList* tags = nullptr);
KORVEL_EXPORT void StripName(wchar_t* dst, const wchar_t* src, TagList* tags = nullptr);

// True for every address but null.
KORVEL_EXPORT bool KRIsValidAddress(const void* address, unsigned long size, bool write);

}  // namespace Korvel

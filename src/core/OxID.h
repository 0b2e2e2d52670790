#pragma once

#include <cstdarg>
#include <cstdint>

#include "core/0ReusePool.h"
#include "core/Export.h"

namespace Korvel {

class TagList;
template <class T>
class KORVEL_EXPORT OxStringT;

// The hash of names and keys: 32 bits, blind to the case of A to Z and of nothing else. A null text
// and a length below 1 give 0. The form with a length does not stop at a NUL. The list is not used.
KORVEL_EXPORT uint32_t GetHashValue(const char* text, TagList* tags = nullptr);
KORVEL_EXPORT uint32_t GetHashValue(const char* text, int length, TagList* tags = nullptr);

// An identifier: the name of a member, a key or a message.
//
// It is exactly one pointer: null, or a borrowed text that must outlive it, or a counted text cell
// that it shares. A literal therefore costs nothing and a copy one atomic step. All
// text is UTF-8; an empty text and null count as equal.
//
// Threads: identifiers that share a cell may be used on several threads, one identifier on one.
// Failure: where memory has run out the identifier becomes null.
class KORVEL_EXPORT OxID : public Reuser {
public:
    OxID() = default;
    OxID(const OxID& other);
    OxID(OxID&& other) noexcept : m_Text(other.m_Text) { other.m_Text = nullptr; }

    // A cell is shared whatever `copy` says. A plain text is copied, or borrowed without `copy`.
    // The default borrows: right for literals, wrong for text that goes away.
    OxID(const char* text, bool copy = false);
    OxID(const char* a, const char* b);            // a then b; either may be null
    OxID(const char* text, unsigned long length);  // at most `length` bytes, up to a NUL
    OxID(const OxStringT<char>& text);
    ~OxID();

    OxID& operator=(const OxID& other);
    OxID& operator=(const char* text) { return Set(text), *this; }  // borrows
    OxID& operator=(const OxStringT<char>& text) { return *this = OxID(text); }
    OxID& operator=(OxID&& other) noexcept;
    void Set(const OxID& other);
    void Set(const char* text, bool copy = false);
    void Set(const char* a, const char* b);
    void Set(const char* text, unsigned long length);

    operator const char*() const;  // the text, or null

    OxID& operator+=(const char* text);
    OxID& operator+=(char c);
    OxID operator+(const char* text) const;
    OxID operator+(const OxID& other) const { return *this + other.m_Text; }
    KORVEL_EXPORT friend OxID operator+(const char* text, const OxID& id);

    // Null and empty are equal; otherwise the bytes decide, case included.
    bool operator==(const char* text) const;
    bool operator!=(const char* text) const { return !(*this == text); }
    bool operator==(const OxID& other) const { return *this == static_cast<const char*>(other); }
    bool operator!=(const OxID& other) const { return !(*this == other); }

    // These four may be called on a null object.
    bool IsValid() const;  // not null; an empty text is valid
    bool IsEmpty() const;  // null or no text
    int GetLength() const;
    uint32_t GetHashValue() const;

    // The index of `c` from `start` on, or −1; a start outside of the text gives −1.
    int Find(char c, int start = 0) const;
    // The same backwards; `start` −1 is the last byte.
    int ReverseFind(char c, int start = -1) const;

    OxID Mid(int start, int length = -1) const;  // a negative length runs to the end
    OxID Left(int length) const;

    // A null argument is always a match; a null identifier matches an empty argument alone.
    bool BeginsWith(const char* text) const;
    bool BeginsWithNoCase(const char* text) const;
    bool EndsWith(const char* text) const;
    bool EndsWithNoCase(const char* text) const;

    // Groups are the parts before a dot: "a.b" is in group "a".
    bool IsInGroup() const;
    bool IsInGroup(const char* group) const;
    bool IsSameGroup(const char* other) const;
    bool IsValidSymbol() const;

    // Replace the text, or append to it. A null format makes it null. The arguments may point into
    // the identifier's own text.
    void PrintF(const char* format, ...) KORVEL_PRINTF(2, 3);
    void CatF(const char* format, ...) KORVEL_PRINTF(2, 3);

    // Keeps what may stand in a symbol, see StripName in OxString.h. Null stays null.
    void Strip();

private:
    static OxID FromCell(const char* cell);  // takes over a new cell
    void Take(const char* cell);             // the same, in place of the present text
    bool Owns(const char* text) const;
    void SetFormatted(const char* head, const char* format, va_list args) KORVEL_PRINTF(3, 0);

    const char* m_Text = nullptr;
};

static_assert(sizeof(OxID) == sizeof(char*));

// The empty identifier.
KORVEL_EXPORT extern const OxID NOID;

}  // namespace Korvel

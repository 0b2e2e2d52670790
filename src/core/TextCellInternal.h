#pragma once

#include <atomic>
#include <cstdint>

namespace Korvel {

// The counted text that identifiers and values share.
//
// A cell is one pool block: a 32-bit count, the marker byte 0xFF, the text, a NUL. A holder's
// pointer points at the marker, so a `char const*` is told apart by its first byte: 0xFF means a
// cell, anything else is a plain C string. Therefore a plain text must never begin with 0xFF;
// whoever brings in foreign bytes (files, environment, scripts, the wire) passes them through
// SafeFirstByte first. Debug builds assert that a cell is one.
//
// Threads: the count is atomic; the text does not change once a second holder can see it.
namespace TextCell {

constexpr char kMarker = '\xFF';

// A new cell with count 1 and room for `length` bytes; the marker and the last NUL stand, the text
// is the caller's to write. Null when memory has run out.
char* New(unsigned long length);
// The same with these bytes for its text.
char* New(const char* text, unsigned long length);

// Asserts in debug builds that `cell` points at a cell's marker.
#ifdef NDEBUG
inline void Check(const char* cell) {}
#else
void Check(const char* cell);
#endif

inline bool IsCell(const char* p) {
    return p && *p == kMarker;
}

inline std::atomic<uint32_t>& Count(const char* cell) {
    return *reinterpret_cast<std::atomic<uint32_t>*>(const_cast<char*>(cell) - sizeof(uint32_t));
}

// The text of a holder's pointer: null for null.
inline const char* Text(const char* p) {
    return IsCell(p) ? p + 1 : p;
}

// Adds a holder, if the pointer is to a cell. Returns the pointer.
inline const char* Use(const char* p) {
    if (IsCell(p)) {
        Check(p);
        Count(p).fetch_add(1, std::memory_order_relaxed);
    }
    return p;
}

// A holder's pointer for a text that need not last: the cell with one holder more, or a new cell
// with a copy of a plain text. Null when memory has run out.
const char* UseOrCopy(const char* text);

void Free(const char* cell);

// Drops a holder, if the pointer is to a cell; the last one frees it. A holder that is the only one
// needs no atomic step: nobody else can become another.
inline void Drop(const char* p) {
    if (!IsCell(p)) return;
    std::atomic<uint32_t>& count = Count(p);
    if (count.load(std::memory_order_acquire) == 1 ||
        count.fetch_sub(1, std::memory_order_acq_rel) == 1) {
        Free(p);
    }
}

// For text from outside: the byte with which `c` may stand at the head of a text.
inline char SafeFirstByte(char c) {
    return c == kMarker ? '?' : c;
}

}  // namespace TextCell
}  // namespace Korvel

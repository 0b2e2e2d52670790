#include <cassert>
#include <climits>
#include <cstring>
#include <new>

#include "core/ReusePoolInternal.h"
#include "core/TextCellInternal.h"

namespace Korvel::TextCell {
namespace {

// count, marker and terminator
constexpr unsigned long kOverhead = sizeof(uint32_t) + 2;

#ifndef NDEBUG
// Debug builds sign the unused header word of a cell's block, so that Check can tell a cell from a
// foreign text that merely begins with the marker.
constexpr uint64_t kSignature = 0x6C6C65436F725478;

uint64_t& UnusedHeaderWord(const char* cell) {
    char* block = const_cast<char*>(cell) - sizeof(uint32_t);
    return reinterpret_cast<uint64_t*>(block)[-1];
}
#endif

}  // namespace

char* New(unsigned long length) {
    if (length > INT_MAX - kOverhead) return nullptr;
    char* block = static_cast<char*>(PoolAccess::Alloc(length + kOverhead));
    if (!block) return nullptr;
    char* cell = block + sizeof(uint32_t);
    new (block) std::atomic<uint32_t>(1);
    cell[0] = kMarker;
    cell[length + 1] = '\0';
#ifndef NDEBUG
    UnusedHeaderWord(cell) = kSignature;
#endif
    return cell;
}

char* New(const char* text, unsigned long length) {
    char* cell = New(length);
    if (cell) memcpy(cell + 1, text, length);
    return cell;
}

const char* UseOrCopy(const char* text) {
    return IsCell(text) ? Use(text) : New(text, strlen(text));
}

#ifndef NDEBUG
void Check(const char* cell) {
    assert(UnusedHeaderWord(cell) == kSignature && "a plain text begins with byte 0xFF");
}
#endif

void Free(const char* cell) {
#ifndef NDEBUG
    Check(cell);
    UnusedHeaderWord(cell) = 0;
#endif
    PoolAccess::Free(const_cast<char*>(cell) - sizeof(uint32_t));
}

}  // namespace Korvel::TextCell

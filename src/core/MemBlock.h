#pragma once

#include <cstdint>

#include "core/Export.h"

namespace Korvel {

// A plain record of bytes: a pointer and a size. Whoever fills it frees it; it has no destructor.
//
// The operations below work on blocks of the C heap: a file read into memory, and the compressed
// form, which is "KLBC", the plain size as 32 bits in little-endian order, and a zlib stream. The
// view that ScriptVal::ToMemBlock gives is neither to be freed nor to be compressed in place.
struct KORVEL_EXPORT MemBlock {
    constexpr MemBlock() = default;
    constexpr MemBlock(void* ptr, uint32_t size) : m_Ptr(ptr), m_Size(size) {}

    // Reads a whole file into a new block of the C heap; free it with free(). Null and 0 when the
    // file cannot be read, is empty, or is too large for 32 bits.
    explicit MemBlock(const char* filename);

    // Writes the block to a file, replacing it. False for a null block and when not all bytes could
    // be written.
    bool Save(const char* filename) const;

    // Replaces the block by its compressed or its plain form, and the old one is freed. False, with
    // the block unchanged, when it already has that form, is no valid block of the other, or memory
    // has run out. A block below 4 bytes cannot be compressed.
    bool Compress();
    bool UnCompress();

    void* m_Ptr = nullptr;
    uint32_t m_Size = 0;
};

static_assert(sizeof(MemBlock) == 16);

}  // namespace Korvel

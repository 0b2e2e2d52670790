#include "textform/Heap.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

namespace Korvel::TextForm {

namespace {

constexpr size_t kLargestChunk = 1024 * 1024;

}  // namespace

Heap::~Heap() {
    while (Chunk* chunk = m_Chunks) {
        m_Chunks = chunk->m_Next;
        free(chunk);
    }
    while (LargeBlock* block = m_Large) {
        m_Large = block->m_Next;
        free(block);
    }
}

void* Heap::Cut(size_t index, size_t size) {
    size_t rounded = index * 16;
    if (rounded > m_ChunkRest) {
        if (m_InChunks >= m_Limit) return nullptr;  // blocks of one size do not become others
        auto* chunk = static_cast<Chunk*>(malloc(m_NextChunkSize));
        if (!chunk) return nullptr;
        m_InChunks += m_NextChunkSize;
        chunk->m_Next = m_Chunks;
        m_Chunks = chunk;
        m_ChunkPlace = reinterpret_cast<char*>(chunk + 1);
        m_ChunkRest = m_NextChunkSize - sizeof(Chunk);
        m_NextChunkSize = std::min(m_NextChunkSize * 2, kLargestChunk);
    }
    void* block = m_ChunkPlace;
    m_ChunkPlace += rounded;
    m_ChunkRest -= rounded;
    m_Used += size;
    return block;
}

void* Heap::AllocateLarge(size_t size) {
    auto* block = static_cast<LargeBlock*>(malloc(sizeof(LargeBlock) + size));
    if (!block) return nullptr;
    block->m_Next = m_Large;
    block->m_Link = &m_Large;
    if (m_Large) m_Large->m_Link = &block->m_Next;
    m_Large = block;
    m_Used += size;
    return block + 1;
}

void Heap::FreeLarge(void* p, size_t size) {
    LargeBlock* block = static_cast<LargeBlock*>(p) - 1;
    *block->m_Link = block->m_Next;
    if (block->m_Next) block->m_Next->m_Link = block->m_Link;
    m_Used -= size;
    free(block);
}

// A block that is larger than its size says serves as one of that size, on any list.
void* Heap::KeepShrunk(void* p, size_t oldSize, size_t newSize) {
    if (newSize > oldSize) return nullptr;
    m_Used -= oldSize - newSize;
    return p;
}

void* Heap::Reallocate(void* p, size_t oldSize, size_t newSize) {
    if (p && GetIndex(oldSize) >= kClassCount && GetIndex(newSize) >= kClassCount) {
        if (newSize > oldSize && newSize - oldSize > m_Limit - m_Used) return nullptr;
        auto* moved = static_cast<LargeBlock*>(
            realloc(static_cast<LargeBlock*>(p) - 1, sizeof(LargeBlock) + newSize));
        if (!moved) return KeepShrunk(p, oldSize, newSize);
        *moved->m_Link = moved;
        if (moved->m_Next) moved->m_Next->m_Link = &moved->m_Next;
        m_Used += newSize - oldSize;
        return moved + 1;
    }
    void* block = Allocate(newSize);
    if (!block) return KeepShrunk(p, oldSize, newSize);
    if (p) memcpy(block, p, std::min(oldSize, newSize));
    Free(p, oldSize);
    return block;
}

}  // namespace Korvel::TextForm

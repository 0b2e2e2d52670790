// The memory of a machine. Small blocks are cut from chunks and come back to lists by size, so that
// a short life costs little and its end next to nothing: the chunks go as they are.
#pragma once

#include <cstddef>
#include <cstdint>

namespace Korvel::TextForm {

// Ownership: all blocks belong to the heap, and go with it.
// Threads:   one at a time.
// Failure:   null, when the system has none or the limit is reached.
class Heap {
public:
    Heap() = default;
    Heap(const Heap&) = delete;
    Heap& operator=(const Heap&) = delete;
    ~Heap();

    // The size of a block has to be given back with it.
    void* Allocate(size_t size) {
        if (size > m_Limit - m_Used) return nullptr;
        size_t index = GetIndex(size);
        if (index >= kClassCount) return AllocateLarge(size);
        FreeBlock* block = m_Free[index];
        if (!block) return Cut(index, size);
        m_Free[index] = block->m_Next;
        m_Used += size;
        return block;
    }
    void Free(void* p, size_t size) {
        if (!p) return;
        size_t index = GetIndex(size);
        if (index >= kClassCount) return FreeLarge(p, size);
        m_Used -= size;
        auto* block = static_cast<FreeBlock*>(p);
        block->m_Next = m_Free[index];
        m_Free[index] = block;
    }
    // Never fails when it shrinks.
    void* Reallocate(void* p, size_t oldSize, size_t newSize);

    size_t GetUsed() const { return m_Used; }  // bytes in blocks
    void SetLimit(size_t bytes) { m_Limit = bytes < m_Used ? m_Used : bytes; }

private:
    struct FreeBlock {
        FreeBlock* m_Next;
    };
    struct Chunk {
        Chunk* m_Next;
        size_t m_Padding;
    };
    struct LargeBlock {
        LargeBlock* m_Next;
        LargeBlock** m_Link;
    };

// Each block by itself, where somebody watches over blocks.
#if defined(__SANITIZE_ADDRESS__)
    static constexpr size_t kClassCount = 0;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
    static constexpr size_t kClassCount = 0;
#else
    static constexpr size_t kClassCount = 33;
#endif
#else
    static constexpr size_t kClassCount = 33;
#endif

    static size_t GetIndex(size_t size) {
        return (size + 15) / 16;
    }
    void* Cut(size_t index, size_t size);
    void* AllocateLarge(size_t size);
    void FreeLarge(void* p, size_t size);
    void* KeepShrunk(void* p, size_t oldSize, size_t newSize);

    size_t m_Used = 0;
    size_t m_Limit = SIZE_MAX / 2;
    char* m_ChunkPlace = nullptr;  // where the next small block is cut
    size_t m_ChunkRest = 0;
    size_t m_NextChunkSize = 16 * 1024;
    size_t m_InChunks = 0;
    Chunk* m_Chunks = nullptr;
    LargeBlock* m_Large = nullptr;
    FreeBlock* m_Free[kClassCount + 1] = {};
};

}  // namespace Korvel::TextForm

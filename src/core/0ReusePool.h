#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <new>

#include "core/Export.h"

namespace Korvel {

// The allocator under all values, strings, identifiers and packets: freed blocks are kept in lists
// by size and handed out again, so that steady traffic rarely reaches malloc.
//
// Sizes 1 to 8192 are pooled in classes of 8 bytes, one free list each. In front of the lists every
// thread keeps magazines of its own: per class at most 64 free blocks and 16 KiB, 256 KiB a thread,
// none for blocks above 1 KiB. They are filled and emptied in batches, so that the usual Alloc and
// Free touch nothing that is shared. Within a thread the block freed last is handed out first.
//
// Layout:    every block is a malloc block of its own with a 16-byte header. Its first word is the
//            user size while the block is in use and the next free block while it is not.
// Life:      there is one manager, g_ReusePoolMgr. It works before its constructor has run and
//            after its destructor: blocks then come from malloc and go to free.
// Threads:   any thread may free a block that another one allocated. Threads that end give back
//            their magazines; a forked child forgets those of the threads it does not have.
// Failure:   Alloc returns null when malloc does. Nothing throws.
class KORVEL_EXPORT ReusePoolManager {
public:
    static constexpr unsigned long kMaxSize = 8192;
    static constexpr unsigned kClassCount = 1024;

    ReusePoolManager();
    ReusePoolManager(const ReusePoolManager&) = delete;
    ReusePoolManager& operator=(const ReusePoolManager&) = delete;
    virtual ~ReusePoolManager();

    // The one manager of the process.
    static ReusePoolManager& Get();

    // A block of at least `size` bytes, aligned to 16, its contents undefined; `size` 0 gives a
    // valid block too. Null when memory has run out. The caller owns it until Free.
    void* Alloc(unsigned long size);
    void* AllocTrace(unsigned long size);  // the same as Alloc

    // Takes a block back. Null is ignored.
    void Free(void* p);

    // The bytes held in free blocks, headers included, wherever they lie: of the class for `size`,
    // 0 for a size that is not pooled, or of all classes for size 0. Not a snapshot while other
    // threads allocate.
    uint64_t GetSize(unsigned long size);

    // Gives every free block back to the system. Blocks in use are not touched. Blocks in the
    // magazines of other threads stop counting at once; their threads release them at their next
    // use of the pool or when they end.
    void FreeAll();

    void EnableLeakDetection(bool) {}  // has no effect

private:
    friend struct PoolAccess;
    struct Block;

    std::atomic<uint64_t> m_MaxSize;  // 0 outside of the manager's life

    // Class k has index k - 1. A lock word is the number of free blocks in the list, or 0xFFFFFFFF
    // while a thread works on it; the list is guarded by its word.
    Block* m_Lists[kClassCount];
    std::atomic<uint32_t> m_Locks[kClassCount];
};

KORVEL_EXPORT extern ReusePoolManager g_ReusePoolMgr;

inline ReusePoolManager& ReusePoolManager::Get() {
    return g_ReusePoolMgr;
}

// Base for classes whose objects come from the pools. It adds no data and no virtual operation.
// A `new` of such a class gives null when memory has run out; its constructor is then not run.
class KORVEL_EXPORT Reuser {
public:
    static void* operator new(size_t size) noexcept;
    static void* operator new[](size_t size) noexcept;
    static void* operator new(size_t, void* where) noexcept { return where; }
    static void* operator new(size_t, std::align_val_t) = delete;  // blocks are aligned to 16
    static void operator delete(void* p) noexcept;
    static void operator delete[](void* p) noexcept;
};

}  // namespace Korvel

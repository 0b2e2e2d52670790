#pragma once

#include <atomic>
#include <bit>
#include <cstdint>

#include "core/0ReusePool.h"
#include "core/FaultsInternal.h"

#if defined(__SANITIZE_ADDRESS__)
#define KORVEL_POISONING 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define KORVEL_POISONING 1
#endif
#endif
#ifdef KORVEL_POISONING
#include <sanitizer/asan_interface.h>
#endif

// The inside of the pools, for the sources that allocate so often that a call matters.
namespace Korvel {

struct ReusePoolManager::Block {
    union {
        uint64_t m_Size;  // in use: bytes the user may touch
        Block* m_Next;    // free: the next free block
    };
    // On a class list alone. The first block of a batch knows the last one, which knows what is in
    // between; a block that is a batch by itself has null.
    union {
        Block* m_Last;
        struct {
            uint32_t m_Length;
            uint32_t m_Sender;
        } m_Batch;
    };
};

// Where blocks live, and how the short ways to and from there go.
namespace Pools {

constexpr unsigned long kMaxMagazineSize = 1024;
constexpr unsigned kRackCount = kMaxMagazineSize / 8 + 1;  // by class number; rack 0 stays empty

constexpr unsigned ClassOf(unsigned long size) {
    return static_cast<unsigned>((size + 7) / 8);
}
constexpr unsigned long SizeOf(unsigned k) {
    return k * 8ul;
}

using Count = std::atomic<uint32_t>;

inline uint32_t Get(const Count& count) {
    return count.load(std::memory_order_relaxed);
}
inline void Set(Count& count, uint32_t value) {
    count.store(value, std::memory_order_relaxed);
}

}  // namespace Pools

// The parts of the manager that need its private types: blocks and class lists.
struct PoolAccess {
    using Block = ReusePoolManager::Block;

    static ReusePoolManager& TheManager() { return g_ReusePoolMgr; }
    static uint64_t MaxSize() { return TheManager().m_MaxSize.load(std::memory_order_relaxed); }

    // The same as the manager's, in line.
    static void* Alloc(unsigned long size);
    static void Free(void* p);

    static void* AllocSlow(unsigned long size);
    static void FreeSlow(Block* block);
    static Block* NewBlock(unsigned long size);

    static uint32_t LockClass(unsigned k);
    static void UnlockClass(unsigned k, uint32_t count);
    static Block*& List(unsigned k) { return TheManager().m_Lists[k - 1]; }
    static uint32_t ListCount(unsigned k);
    static bool IsListEmpty(unsigned k);
    static void PutBatch(unsigned k, Block* first, Block* last, uint32_t length);
    static Block* TakeOne(unsigned k);
    static Block* TakeBatch(unsigned k, uint32_t most, uint32_t sender, uint32_t& taken);
    static void FreeList(unsigned k);
};

// The free blocks that one thread keeps for itself, up to 1 KiB a block. They keep their size in
// their header.
//
// The owner alone reads and writes it, but for the counts and the epoch, which GetSize reads, and
// the links, which s_RegistryLock guards. The short path runs without a NoKill guard: a thread that
// is ended between any two of its stores loses the block at hand and nothing else.
struct Magazine {
    using Block = PoolAccess::Block;

    struct Rack {
        Block** m_Slots = nullptr;  // behind the magazine, RackSize() of them
        Pools::Count m_Count{0};
        uint32_t m_Limit = 0;  // granted blocks
    };

    Pools::Count m_Epoch{0};
    uint32_t m_Granted = 0;  // bytes, of all racks
    uint32_t m_Serial = 0;   // tells its batches from others
    Magazine* m_Next = nullptr;
    Magazine* m_Prev = nullptr;
    Rack m_Racks[Pools::kRackCount] = {};  // by class number

    static Magazine* New();
    bool Grant(unsigned k, uint32_t limit);
    bool GrantMore(unsigned k);
    void GrantFirst(unsigned k);
    Block* Take(unsigned k);
    void Put(unsigned k, Block* block);
    void Send(unsigned k, uint32_t count);
    void Empty();
};

// The calling thread's magazine, made if need be; it stays where it is until the thread ends. Null
// when memory has run out: the thread then goes without one for good.
Magazine* ObtainMagazine();

// Gives back the magazine of a thread that was ended without running its exit handlers. The thread
// must be gone.
void AbandonMagazine(Magazine* magazine);

namespace Pools {

// Raised by FreeAll: what a magazine of an older epoch holds has to go to the system.
extern constinit Count g_Epoch;

// The calling thread's magazine, or a stand-in whose epoch never comes.
extern constinit thread_local Magazine* t_Magazine __attribute__((tls_model("initial-exec")));

inline void Poison(PoolAccess::Block* block, size_t size) {
#ifdef KORVEL_POISONING
    ASAN_POISON_MEMORY_REGION(block + 1, size);
#endif
}

// Makes a free block the user's.
inline void* HandOut(PoolAccess::Block* block, size_t size, size_t roundedSize) {
#ifdef KORVEL_POISONING
    ASAN_UNPOISON_MEMORY_REGION(block + 1, size);
    ASAN_POISON_MEMORY_REGION(reinterpret_cast<char*>(block + 1) + size, roundedSize - size);
#endif
    return block + 1;
}

}  // namespace Pools

// The short paths do what Magazine::Take and Put do first, with nothing in the way.

inline void* PoolAccess::Alloc(unsigned long size) {
    using namespace Pools;
    Magazine* magazine = t_Magazine;
    if (Faults::ShouldFail()) return nullptr;
    if (size - 1 < kMaxMagazineSize && Get(magazine->m_Epoch) == Get(g_Epoch)) [[likely]] {
        unsigned k = ClassOf(size);
        Magazine::Rack& rack = magazine->m_Racks[k];
        if (uint32_t count = Get(rack.m_Count)) [[likely]] {
            Set(rack.m_Count, count - 1);
            return HandOut(rack.m_Slots[count - 1], size, SizeOf(k));
        }
    }
    return AllocSlow(size);
}

inline void PoolAccess::Free(void* p) {
    using namespace Pools;
    if (!p) return;
    Block* block = static_cast<Block*>(p) - 1;
    uint64_t size = block->m_Size;
    Magazine* magazine = t_Magazine;
    // One comparison for a multiple of 8 from 8 to kMaxMagazineSize: other low bits turn up on top.
    uint64_t index = std::rotr(size - 8, 3);
    if (index < kRackCount - 1 && Get(magazine->m_Epoch) == Get(g_Epoch)) [[likely]] {
        Magazine::Rack& rack = magazine->m_Racks[index + 1];
        uint32_t count = Get(rack.m_Count);
        if (count < rack.m_Limit) [[likely]] {
            Poison(block, size);
            rack.m_Slots[count] = block;
            std::atomic_signal_fence(std::memory_order_release);
            Set(rack.m_Count, count + 1);
            return;
        }
    }
    FreeSlow(block);
}

}  // namespace Korvel

// The reuse pools.
//
// A block travels: malloc -> user -> the freeing thread's magazine -> (in batches) the list of its
// class -> (in batches) a magazine -> user, and back to the system in FreeAll alone.
//
// A class of a magazine is a rack, a stack of pointers. Free pushes and Alloc pops; a full rack
// sends its older half to the class list as one batch, an empty one takes a batch from there. A
// thread prefers batches that it has sent itself, because their blocks are in its processor's
// cache.
//
// A rack may hold only as much as it has been granted. Grants start small, double while a class is
// busy, and add up to 256 KiB at most; a class that finds nothing left makes the thread give back
// everything and start again.
#include "core/0ReusePool.h"

#include <pthread.h>

#include <algorithm>
#include <bit>
#include <cstdint>
#include <cstdlib>
#include <new>

#include "Platform/NoKillInternal.h"
#include "core/FaultsInternal.h"
#include "core/ReusePoolInternal.h"
#include "core/SpinLock.h"

namespace Korvel {

using namespace Pools;

namespace {

constexpr uint32_t kLocked = 0xFFFFFFFF;
constexpr uint32_t kNoEpoch = 0xFFFFFFFF;  // the manager's epoch never gets there

constexpr uint32_t kMaxRackBlocks = 64;
constexpr uint32_t kMaxRackBytes = 16 * 1024;
constexpr uint32_t kMaxThreadBytes = 256 * 1024;
constexpr uint32_t kFirstGrant = 8;
constexpr int kBatchesLookedAt = 3;  // for one that the thread has sent itself

constexpr size_t kHeaderSize = 16;

constexpr uint32_t BlockBytes(unsigned k) {
    return static_cast<uint32_t>(SizeOf(k) + kHeaderSize);
}

// The most blocks that a rack may hold.
constexpr uint32_t RackSize(unsigned k) {
    return k ? std::min(kMaxRackBlocks, kMaxRackBytes / BlockBytes(k)) : 0;
}

constexpr uint32_t TotalRackSize() {
    uint32_t total = 0;
    for (unsigned k = 0; k < kRackCount; k++) total += RackSize(k);
    return total;
}

constinit Count s_NextSerial{1};

// Stand-ins, so that the short path needs no test for null: their epoch never comes.
constinit Magazine s_NoMagazine{.m_Epoch = kNoEpoch};    // the thread has not allocated yet
constinit Magazine s_GoneMagazine{.m_Epoch = kNoEpoch};  // the thread is ending, or goes without

}  // namespace

constinit Count Pools::g_Epoch{0};
constinit thread_local Magazine* Pools::t_Magazine = &s_NoMagazine;

namespace {

constinit SpinLock s_RegistryLock;
constinit Magazine* s_Registry = nullptr;  // all magazines but the stand-ins
constinit uint32_t s_ForkCounts[ReusePoolManager::kClassCount] = {};
pthread_key_t s_ExitKey;
constinit bool s_HasExitKey = false;  // without one, nobody would give back a magazine

// The calling thread's magazine, up to date with the epoch, made if need be; null where the thread
// is ending, memory has run out, or the manager is not alive.
Magazine* CurrentMagazine() {
    Magazine* magazine = t_Magazine;
    if (magazine == &s_GoneMagazine) return nullptr;
    if (magazine == &s_NoMagazine) {
        if (!PoolAccess::MaxSize() || !s_HasExitKey) return nullptr;
        magazine = Magazine::New();
        if (!magazine) return nullptr;
        if (pthread_setspecific(s_ExitKey, magazine) != 0) {
            free(magazine);
            return nullptr;
        }
        t_Magazine = magazine;
        AutoSpinLock lock(s_RegistryLock);
        magazine->m_Next = s_Registry;
        if (s_Registry) s_Registry->m_Prev = magazine;
        s_Registry = magazine;
        return magazine;
    }
    uint32_t epoch = Get(g_Epoch);
    if (Get(magazine->m_Epoch) != epoch) {
        magazine->Empty();
        if (!PoolAccess::MaxSize()) return nullptr;
        Set(magazine->m_Epoch, epoch);
    }
    return magazine;
}

void DeleteMagazine(Magazine* magazine) {
    magazine->Empty();
    {
        AutoSpinLock lock(s_RegistryLock);
        (magazine->m_Prev ? magazine->m_Prev->m_Next : s_Registry) = magazine->m_Next;
        if (magazine->m_Next) magazine->m_Next->m_Prev = magazine->m_Prev;
    }
    free(magazine);
}

void OnThreadExit(void* magazine) {
    Platform::NoKill noKill;
    t_Magazine = &s_GoneMagazine;
    DeleteMagazine(static_cast<Magazine*>(magazine));
}

uint64_t CountInMagazines(unsigned k) {
    if (k >= kRackCount) return 0;
    uint64_t count = 0;
    AutoSpinLock lock(s_RegistryLock);
    for (const Magazine* magazine = s_Registry; magazine; magazine = magazine->m_Next) {
        if (Get(magazine->m_Epoch) == Get(g_Epoch)) count += Get(magazine->m_Racks[k].m_Count);
    }
    return count;
}

// A fork copies one thread. It must find no list half changed, and the magazines of the threads
// that it did not copy are lost to the child.

void BeforeFork() {
    Platform::AddNoKillDepth(1);
    s_RegistryLock.Obtain();
    for (unsigned k = 1; k <= ReusePoolManager::kClassCount; k++) {
        s_ForkCounts[k - 1] = PoolAccess::LockClass(k);
    }
}

void AfterForkInParent() {
    for (unsigned k = 1; k <= ReusePoolManager::kClassCount; k++) {
        PoolAccess::UnlockClass(k, s_ForkCounts[k - 1]);
    }
    s_RegistryLock.Release();
    Platform::AddNoKillDepth(-1);
}

void AfterForkInChild() {
    bool hasOwn = t_Magazine != &s_NoMagazine && t_Magazine != &s_GoneMagazine;
    s_Registry = hasOwn ? t_Magazine : nullptr;
    if (hasOwn) t_Magazine->m_Next = t_Magazine->m_Prev = nullptr;
    Platform::t_IsKillDue = false;  // a kill that comes during the fork is for the parent
    AfterForkInParent();
}

}  // namespace

void* PoolAccess::AllocSlow(unsigned long size) {
    Platform::NoKill noKill;
    Faults::Uncounted uncounted;
    Magazine* magazine = CurrentMagazine();
    unsigned long rounded = size;
    Block* block = nullptr;
    if (size - 1 < MaxSize()) {
        unsigned k = ClassOf(size);
        rounded = SizeOf(k);
        block = magazine && k < kRackCount ? magazine->Take(k) : TakeOne(k);
    }
    if (!block) block = NewBlock(rounded);
    return block ? HandOut(block, size, rounded) : nullptr;
}

void PoolAccess::FreeSlow(Block* block) {
    Platform::NoKill noKill;
    Faults::Uncounted uncounted;
    Magazine* magazine = CurrentMagazine();
    uint64_t size = block->m_Size;
    if (size < 8 || size > MaxSize()) {
        free(block);
        return;
    }
    unsigned k = static_cast<unsigned>(size / 8);
    Poison(block, size);
    if (magazine && k < kRackCount) {
        block->m_Size = SizeOf(k);  // a block from before the manager's life has its true size
        magazine->Put(k, block);
    } else {
        PutBatch(k, block, block, 1);
    }
}

PoolAccess::Block* PoolAccess::NewBlock(unsigned long size) {
    if (size > SIZE_MAX - kHeaderSize) return nullptr;
    Block* block = static_cast<Block*>(malloc(size + kHeaderSize));
    if (!block) return nullptr;
    block->m_Size = size;
    return block;
}

uint32_t PoolAccess::LockClass(unsigned k) {
    Count& word = TheManager().m_Locks[k - 1];
    SpinWait wait;
    for (;;) {
        uint32_t count = word.exchange(kLocked, std::memory_order_acquire);
        if (count != kLocked) return count;
        while (Get(word) == kLocked) wait.Step();
    }
}

void PoolAccess::UnlockClass(unsigned k, uint32_t count) {
    TheManager().m_Locks[k - 1].store(count, std::memory_order_release);
}

uint32_t PoolAccess::ListCount(unsigned k) {
    uint32_t count = LockClass(k);
    UnlockClass(k, count);
    return count;
}

// A look without the lock, which spares it where blocks are still being made.
bool PoolAccess::IsListEmpty(unsigned k) {
    return Get(TheManager().m_Locks[k - 1]) == 0;
}

// Puts linked blocks, whose last one has no link yet, in front of the list of their class. The
// batch's data must stand.
void PoolAccess::PutBatch(unsigned k, Block* first, Block* last, uint32_t length) {
    if (first == last) first->m_Last = nullptr;
    uint32_t count = LockClass(k);
    last->m_Next = List(k);
    List(k) = first;
    UnlockClass(k, count + length);
}

PoolAccess::Block* PoolAccess::TakeOne(unsigned k) {
    uint32_t taken;
    Block* block = IsListEmpty(k) ? nullptr : TakeBatch(k, 1, 0, taken);
    if (block) block->m_Size = SizeOf(k);
    return block;
}

// Takes a batch, or the first `most` blocks of one, off the list of a class: the newest batch of
// the sender's among the first few, or else the newest of all. Null when the list is empty. The
// last block taken keeps its link.
PoolAccess::Block* PoolAccess::TakeBatch(unsigned k, uint32_t most, uint32_t sender,
                                         uint32_t& taken) {
    taken = 0;
    uint32_t count = LockClass(k);
    Block** link = &List(k);
    Block** place = link;
    for (int i = 0; i < kBatchesLookedAt && *place; i++) {
        Block* last = (*place)->m_Last;
        if (last && last->m_Batch.m_Sender == sender) {
            link = place;
            break;
        }
        place = &(last ? last : *place)->m_Next;
    }
    Block* first = *link;
    if (first) {
        Block* last = first->m_Last ? first->m_Last : first;
        uint32_t length = first == last ? 1 : last->m_Batch.m_Length;
        if (length <= most) {
            taken = length;
            *link = last->m_Next;
        } else {
            Block* rest = first;
            for (taken = 0; taken < most; taken++) rest = rest->m_Next;
            rest->m_Last = rest == last ? nullptr : last;
            if (rest != last) last->m_Batch.m_Length = length - most;
            *link = rest;
        }
    }
    UnlockClass(k, count - taken);
    return first;
}

void PoolAccess::FreeList(unsigned k) {
    LockClass(k);
    Block* block = List(k);
    List(k) = nullptr;
    UnlockClass(k, 0);
    while (block) {
        Block* next = block->m_Next;
        free(block);
        block = next;
    }
}

Magazine* Magazine::New() {
    void* memory = malloc(sizeof(Magazine) + TotalRackSize() * sizeof(Block*));
    if (!memory) return nullptr;
    Magazine* magazine = new (memory) Magazine;
    Set(magazine->m_Epoch, Get(g_Epoch));
    magazine->m_Serial = s_NextSerial.fetch_add(1, std::memory_order_relaxed);
    Block** slots = reinterpret_cast<Block**>(magazine + 1);
    for (unsigned k = 0; k < kRackCount; k++) {
        magazine->m_Racks[k].m_Slots = slots;
        slots += RackSize(k);
    }
    return magazine;
}

// Lets a class hold `limit` blocks, if the thread's total allows it.
bool Magazine::Grant(unsigned k, uint32_t limit) {
    limit = std::min(limit, RackSize(k));
    uint32_t more = (limit - m_Racks[k].m_Limit) * BlockBytes(k);
    if (more == 0 || more > kMaxThreadBytes - m_Granted) return false;
    m_Granted += more;
    m_Racks[k].m_Limit = limit;
    return true;
}

void Magazine::GrantFirst(unsigned k) {
    if (Grant(k, kFirstGrant)) return;
    Empty();
    Grant(k, kFirstGrant);
}

// A class that has emptied or filled its rack is busy, and may move larger batches from now on.
bool Magazine::GrantMore(unsigned k) {
    return Grant(k, 2 * m_Racks[k].m_Limit);
}

// A block from the rack or, with a whole batch, from the class list; null when both are empty.
Magazine::Block* Magazine::Take(unsigned k) {
    Rack& rack = m_Racks[k];
    uint32_t count = Get(rack.m_Count);
    if (count == 0) {
        if (PoolAccess::IsListEmpty(k)) return nullptr;
        if (rack.m_Limit == 0) {
            GrantFirst(k);
        } else {
            GrantMore(k);
        }
        Block* block = PoolAccess::TakeBatch(k, rack.m_Limit / 2, m_Serial, count);
        for (uint32_t i = count; i-- > 0;) {
            rack.m_Slots[i] = block;
            Block* next = block->m_Next;
            block->m_Size = SizeOf(k);
            block = next;
        }
        if (count == 0) return nullptr;
    }
    Set(rack.m_Count, count - 1);
    return rack.m_Slots[count - 1];
}

void Magazine::Put(unsigned k, Block* block) {
    Rack& rack = m_Racks[k];
    if (rack.m_Limit == 0) GrantFirst(k);
    if (Get(rack.m_Count) >= rack.m_Limit && !GrantMore(k)) Send(k, rack.m_Limit / 2);
    uint32_t count = Get(rack.m_Count);
    rack.m_Slots[count] = block;
    Set(rack.m_Count, count + 1);
}

// Sends the oldest `count` blocks of a rack to the class list, the newest of them first.
void Magazine::Send(unsigned k, uint32_t count) {
    Rack& rack = m_Racks[k];
    Block* last = rack.m_Slots[0];
    for (uint32_t i = 1; i < count; i++) rack.m_Slots[i]->m_Next = rack.m_Slots[i - 1];
    Block* first = rack.m_Slots[count - 1];
    first->m_Last = last;
    last->m_Batch = {count, m_Serial};
    PoolAccess::PutBatch(k, first, last, count);
    uint32_t left = Get(rack.m_Count) - count;
    std::copy_n(rack.m_Slots + count, left, rack.m_Slots);
    Set(rack.m_Count, left);
}

// Gives back all blocks and grants: to the class lists, or to the system when FreeAll has asked for
// them or the manager is gone.
void Magazine::Empty() {
    bool isStale = !PoolAccess::MaxSize() || Get(m_Epoch) != Get(g_Epoch);
    for (unsigned k = 1; k < kRackCount; k++) {
        Rack& rack = m_Racks[k];
        uint32_t count = Get(rack.m_Count);
        if (count && isStale) {
            for (uint32_t i = 0; i < count; i++) free(rack.m_Slots[i]);
            Set(rack.m_Count, 0);
        } else if (count) {
            Send(k, count);
        }
        rack.m_Limit = 0;
    }
    m_Granted = 0;
}

// First of all static initialisers, whatever the order of linking, and so the last to be undone.
__attribute__((init_priority(101))) ReusePoolManager g_ReusePoolMgr;

ReusePoolManager::ReusePoolManager() : m_Lists{}, m_Locks{} {
    s_HasExitKey = pthread_key_create(&s_ExitKey, OnThreadExit) == 0;
    pthread_atfork(BeforeFork, AfterForkInParent, AfterForkInChild);
    m_MaxSize.store(kMaxSize, std::memory_order_relaxed);
}

ReusePoolManager::~ReusePoolManager() {
    m_MaxSize.store(0, std::memory_order_relaxed);
    FreeAll();
}

void* ReusePoolManager::Alloc(unsigned long size) {
    return PoolAccess::Alloc(size);
}
void* ReusePoolManager::AllocTrace(unsigned long size) {
    return PoolAccess::Alloc(size);
}
void ReusePoolManager::Free(void* p) {
    PoolAccess::Free(p);
}

uint64_t ReusePoolManager::GetSize(unsigned long size) {
    Platform::NoKill noKill;
    if (size > PoolAccess::MaxSize()) return 0;
    unsigned first = size ? ClassOf(size) : 1;
    unsigned last = size ? first : kClassCount;
    uint64_t bytes = 0;
    for (unsigned k = first; k <= last; k++) {
        bytes += (PoolAccess::ListCount(k) + CountInMagazines(k)) * BlockBytes(k);
    }
    return bytes;
}

void ReusePoolManager::FreeAll() {
    Platform::NoKill noKill;
    g_Epoch.fetch_add(1, std::memory_order_relaxed);
    CurrentMagazine();  // empties the caller's own
    for (unsigned k = 1; k <= kClassCount; k++) PoolAccess::FreeList(k);
}

Magazine* ObtainMagazine() {
    Platform::NoKill noKill;
    Magazine* magazine = CurrentMagazine();
    if (!magazine) t_Magazine = &s_GoneMagazine;
    return magazine;
}

void AbandonMagazine(Magazine* magazine) {
    Platform::NoKill noKill;
    DeleteMagazine(magazine);
}

void* Reuser::operator new(size_t size) noexcept {
    return PoolAccess::Alloc(size);
}
void* Reuser::operator new[](size_t size) noexcept {
    return PoolAccess::Alloc(size);
}
void Reuser::operator delete(void* p) noexcept {
    PoolAccess::Free(p);
}
void Reuser::operator delete[](void* p) noexcept {
    PoolAccess::Free(p);
}

}  // namespace Korvel

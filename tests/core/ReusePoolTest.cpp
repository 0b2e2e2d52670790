#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <barrier>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <future>
#include <mutex>
#include <random>
#include <thread>
#include <vector>

#include "core/0ReusePool.h"
#include "core/FaultsInternal.h"

namespace Korvel {
namespace {

constexpr unsigned long kHeader = 16;

ReusePoolManager& Pools() {
    return ReusePoolManager::Get();
}

uint64_t HeldBytes(unsigned long size, unsigned long count) {
    return ((size + 7) / 8 * 8 + kHeader) * count;
}

std::vector<void*> AllocMany(unsigned long size, size_t count) {
    std::vector<void*> blocks(count);
    for (void*& block : blocks) block = Pools().Alloc(size);
    return blocks;
}

void FreeMany(const std::vector<void*>& blocks) {
    for (void* block : blocks) Pools().Free(block);
}

class ReusePool : public testing::Test {
protected:
    ReusePool() { Pools().FreeAll(); }
};

TEST_F(ReusePool, PoolsExactlyTheSizesFrom1To8192) {
    struct Case {
        unsigned long size;
        bool isPooled;
    };
    const Case cases[] = {{0, false},   {1, true},    {7, true},     {8, true},      {1024, true},
                          {1025, true}, {8192, true}, {8193, false}, {100000, false}};
    for (const Case& c : cases) {
        Pools().FreeAll();
        void* p = Pools().Alloc(c.size);
        ASSERT_NE(p, nullptr) << c.size;
        EXPECT_EQ(reinterpret_cast<uintptr_t>(p) % 16, 0u) << c.size;
        memset(p, 0xAB, c.size);
        EXPECT_EQ(Pools().GetSize(0), 0u) << c.size;
        Pools().Free(p);
        EXPECT_EQ(Pools().GetSize(0), c.isPooled ? HeldBytes(c.size, 1) : 0u) << c.size;
        EXPECT_EQ(Pools().GetSize(c.size), Pools().GetSize(0)) << c.size;
    }
    EXPECT_EQ(Pools().GetSize(ULONG_MAX), 0u);
    EXPECT_EQ(Pools().Alloc(ULONG_MAX), nullptr);
    EXPECT_EQ(Pools().Alloc(ULONG_MAX - 20), nullptr);
    Pools().Free(nullptr);
}

// More blocks than a magazine holds, in classes with and without one: the order must hold across
// batches, and a size must find the blocks of every size of its class.
TEST_F(ReusePool, HandsOutTheBlockFreedLast) {
    for (unsigned long size : {8ul, 64ul, 256ul, 1024ul, 1032ul, 8192ul}) {
        std::vector<void*> blocks = AllocMany(size, 300);
        FreeMany(blocks);
        EXPECT_EQ(Pools().GetSize(size), HeldBytes(size, blocks.size())) << size;
        for (size_t i = blocks.size(); i-- > 0;) ASSERT_EQ(Pools().Alloc(size - 7), blocks[i]) << i;
        EXPECT_EQ(Pools().GetSize(size), 0u) << size;
        FreeMany(blocks);
    }
}

TEST_F(ReusePool, FreeAllGivesBackEveryFreeBlockAndNoOther) {
    std::vector<void*> live = AllocMany(40, 100);
    for (unsigned long size = 8; size <= 8192; size += 8) FreeMany(AllocMany(size, 3));
    EXPECT_GT(Pools().GetSize(0), 0u);
    Pools().FreeAll();
    EXPECT_EQ(Pools().GetSize(0), 0u);
    for (void* p : live) memset(p, 1, 40);
    FreeMany(live);
    EXPECT_EQ(Pools().GetSize(40), HeldBytes(40, 100));
}

// The free blocks of a size that another thread cannot get at, because this one keeps them.
uint64_t CountKept(unsigned long size) {
    return std::async(std::launch::async,
                      [size] {
                          std::vector<void*> blocks;
                          uint64_t before, after = Pools().GetSize(size);
                          do {
                              before = after;
                              blocks.push_back(Pools().Alloc(size));
                              after = Pools().GetSize(size);
                          } while (after < before);
                          FreeMany(blocks);
                          return after / HeldBytes(size, 1);
                      })
        .get();
}

TEST_F(ReusePool, AThreadKeepsAtMostItsShare) {
    for (unsigned long size : {8ul, 240ul, 512ul, 1024ul, 1032ul, 8192ul}) {
        FreeMany(AllocMany(size, 300));
        uint64_t kept = CountKept(size);
        EXPECT_LE(kept, size > 1024 ? 0 : 64u) << size;
        EXPECT_LE(HeldBytes(size, kept), 16u * 1024) << size;
        EXPECT_TRUE(size > 1024 || kept > 0) << size;
    }
    uint64_t keptBytes = 0;
    for (unsigned long size = 8; size <= 1024; size += 8) FreeMany(AllocMany(size, 100));
    for (unsigned long size = 8; size <= 1024; size += 8) {
        keptBytes += HeldBytes(size, CountKept(size));
    }
    EXPECT_LE(keptBytes, 256u * 1024);
}

TEST_F(ReusePool, AThreadThatEndsGivesBackItsBlocks) {
    void* block = nullptr;
    std::thread([&] {
        block = Pools().Alloc(24);
        Pools().Free(block);
    }).join();
    EXPECT_EQ(Pools().GetSize(24), HeldBytes(24, 1));
    EXPECT_EQ(Pools().Alloc(24), block);
    Pools().Free(block);
}

TEST_F(ReusePool, FreeAllOutdatesTheMagazinesOfOtherThreads) {
    std::barrier<> step(2);
    std::thread other([&] {
        FreeMany(AllocMany(48, 10));
        step.arrive_and_wait();  // filled
        step.arrive_and_wait();  // FreeAll has run
        void* p = Pools().Alloc(48);
        Pools().Free(p);
        step.arrive_and_wait();  // one block counts again
        step.arrive_and_wait();
    });
    step.arrive_and_wait();
    EXPECT_EQ(Pools().GetSize(48), HeldBytes(48, 10));
    Pools().FreeAll();
    EXPECT_EQ(Pools().GetSize(0), 0u);
    step.arrive_and_wait();
    step.arrive_and_wait();
    EXPECT_EQ(Pools().GetSize(48), HeldBytes(48, 1));
    step.arrive_and_wait();
    other.join();
    EXPECT_EQ(Pools().GetSize(48), HeldBytes(48, 1));
}

// Blocks are filled with a pattern of their owner's, checked when they are freed, half of the time
// by another thread.
TEST_F(ReusePool, BlocksOfFourThreadsNeverOverlap) {
    struct Parcel {
        unsigned char* m_Data;
        unsigned m_Size;
        unsigned char m_Pattern;
    };
    std::mutex lock;
    std::deque<Parcel> shared;
    std::atomic<int> damaged = 0;
    auto release = [&](const Parcel& parcel) {
        for (unsigned i = 0; i < parcel.m_Size; i++)
            damaged += parcel.m_Data[i] != parcel.m_Pattern;
        Pools().Free(parcel.m_Data);
    };
    auto work = [&](unsigned seed) {
        std::mt19937 random(seed);
        std::vector<Parcel> own;
        for (int i = 0; i < 20000; i++) {
            if (random() % 2 || own.empty()) {
                unsigned size = 1 + random() % (random() % 8 ? 200 : 9000);
                auto pattern = static_cast<unsigned char>(random());
                auto* data = static_cast<unsigned char*>(Pools().Alloc(size));
                memset(data, pattern, size);
                own.push_back({data, size, pattern});
            } else {
                std::swap(own[random() % own.size()], own.back());
                Parcel parcel = own.back();
                own.pop_back();
                if (random() % 2) {
                    std::lock_guard guard(lock);
                    shared.push_back(parcel);
                    std::swap(parcel, shared.front());
                    shared.pop_front();
                }
                release(parcel);
            }
            if (seed == 0 && i % 5000 == 4999) Pools().FreeAll();
            if (seed == 1 && i % 1000 == 0) Pools().GetSize(0);
        }
        for (const Parcel& parcel : own) release(parcel);
    };
    std::vector<std::thread> threads;
    for (unsigned seed = 0; seed < 4; seed++) threads.emplace_back(work, seed);
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(damaged, 0);
}

// The child has one thread: it must not wait for a lock that another one held, and it must not
// count blocks that only that other one could reach.
TEST_F(ReusePool, WorksInAForkedChild) {
    std::atomic<bool> stop = false;
    std::barrier<> step(2);
    std::thread other([&] {
        FreeMany(AllocMany(72, 20));
        step.arrive_and_wait();
        while (!stop) FreeMany(AllocMany(2000, 50));
    });
    step.arrive_and_wait();
    for (int i = 0; i < 20; i++) {
        pid_t pid = fork();
        if (pid == 0) {
            alarm(30);
            FreeMany(AllocMany(2000, 100));
            bool forgotten = Pools().GetSize(72) == 0;
            Pools().FreeAll();
            _exit(forgotten && Pools().GetSize(0) == 0 ? 0 : 1);
        }
        int status = -1;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        EXPECT_EQ(status, 0);
    }
    stop = true;
    other.join();
}

#ifdef __SANITIZE_ADDRESS__
TEST_F(ReusePool, FreeBlocksArePoisoned) {
    volatile char* p = static_cast<char*>(Pools().Alloc(13));
    EXPECT_DEATH(p[13] = 0, "AddressSanitizer");
    Pools().Free(const_cast<char*>(p));
    EXPECT_DEATH(p[0] = 0, "use-after-poison");
}
#endif

#ifdef KORVEL_FAULTS
TEST_F(ReusePool, AllocFailsAsATestAsks) {
    struct Item : Reuser {
        int m_Value = 7;
    };
    Faults::FailAt(2, false);
    Item* items[] = {new Item, new Item, new Item};
    EXPECT_GE(Faults::Stop(), 3u);
    EXPECT_TRUE(items[0] && !items[1] && items[2]);
    for (Item* item : items) delete item;

    Faults::FailAt(1, true);
    EXPECT_EQ(Pools().Alloc(16), nullptr);
    EXPECT_EQ(Pools().Alloc(16), nullptr);
    Faults::Stop();
}
#endif

}  // namespace
}  // namespace Korvel

// The reuse pools beside malloc and whatever other allocators this machine has: mimalloc, jemalloc
// and tcmalloc are looked up at run time. All are called the same way, through a pointer.
#include <dlfcn.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cstdlib>
#include <thread>

#include "Compare.h"
#include "core/0ReusePool.h"

namespace {

constexpr size_t kLiveBlocks = 512;

struct Allocator {
    const char* m_Name;
    void* (*m_Alloc)(size_t);
    void (*m_Free)(void*);
};

std::vector<Allocator> FindAllocators() {
    void* (*const alloc)(size_t) = Korvel::Reuser::operator new;
    void (*const release)(void*) = Korvel::Reuser::operator delete;
    std::vector<Allocator> found = {{"pools", alloc, release}, {"malloc", malloc, free}};
    const char* const peers[][4] = {
        {"mimalloc", "libmimalloc.so.2", "mi_malloc", "mi_free"},
        {"jemalloc", "libjemalloc.so.2", "malloc", "free"},
        {"tcmalloc", "libtcmalloc_minimal.so.4", "tc_malloc", "tc_free"},
    };
    for (const auto& peer : peers) {
        void* library = dlopen(peer[1], RTLD_NOW | RTLD_LOCAL);
        if (!library) continue;
        auto peerAlloc = reinterpret_cast<void* (*)(size_t)>(dlsym(library, peer[2]));
        auto peerFree = reinterpret_cast<void (*)(void*)>(dlsym(library, peer[3]));
        if (peerAlloc && peerFree) found.push_back({peer[0], peerAlloc, peerFree});
    }
    return found;
}

// One block allocated and freed.
void Pair(benchmark::State& state, const Allocator& allocator) {
    size_t size = static_cast<size_t>(state.range(0));
    for (auto _ : state) {
        void* p = allocator.m_Alloc(size);
        benchmark::DoNotOptimize(p);
        allocator.m_Free(p);
    }
}

// One block of 512 live ones freed and another allocated in its place, in turn.
void Live(benchmark::State& state, const Allocator& allocator) {
    size_t size = static_cast<size_t>(state.range(0));
    std::array<void*, kLiveBlocks> live;
    for (void*& p : live) p = allocator.m_Alloc(size);
    size_t next = 0;
    for (auto _ : state) {
        allocator.m_Free(live[next]);
        live[next] = allocator.m_Alloc(size);
        next = (next + 167) % kLiveBlocks;  // not in the order of allocation
    }
    for (void* p : live) allocator.m_Free(p);
}

// 512 blocks allocated, then all freed, a pair being the unit.
void Burst(benchmark::State& state, const Allocator& allocator) {
    size_t size = static_cast<size_t>(state.range(0));
    std::array<void*, kLiveBlocks> live;
    while (state.KeepRunningBatch(kLiveBlocks)) {
        for (void*& p : live) p = allocator.m_Alloc(size);
        for (void* p : live) allocator.m_Free(p);
    }
}

// A ring through which one thread hands blocks to another.
struct Ring {
    static constexpr size_t kSize = 1024;
    alignas(64) std::atomic<size_t> m_Written{0};
    alignas(64) std::atomic<size_t> m_Read{0};
    alignas(64) std::array<void*, kSize> m_Slots;
};

// Spins, but lets others run when the partner does not: the machine may have fewer free processors
// than the bench has threads.
template <class Condition>
void SpinUntil(Condition isMet) {
    for (int i = 0; !isMet(); i++) {
        if (i % 1000 == 999) std::this_thread::yield();
    }
}

// Ends at a null block.
void FreeAllComing(Ring& ring, const Allocator& allocator) {
    for (size_t read = 0;; read++) {
        SpinUntil([&] { return ring.m_Written.load(std::memory_order_acquire) != read; });
        void* p = ring.m_Slots[read % Ring::kSize];
        if (!p) return;
        allocator.m_Free(p);
        ring.m_Read.store(read + 1, std::memory_order_release);
    }
}

// Blocks freed by another thread than the one that allocated them.
void HandOver(benchmark::State& state, const Allocator& allocator) {
    size_t size = static_cast<size_t>(state.range(0));
    Ring ring;
    std::thread consumer([&] { FreeAllComing(ring, allocator); });
    size_t written = 0;
    auto put = [&](void* p) {
        SpinUntil(
            [&] { return written - ring.m_Read.load(std::memory_order_acquire) < Ring::kSize; });
        ring.m_Slots[written % Ring::kSize] = p;
        ring.m_Written.store(++written, std::memory_order_release);
    };
    for (auto _ : state) put(allocator.m_Alloc(size));
    put(nullptr);
    consumer.join();
}

}  // namespace

int main(int argc, char** argv) {
    // jemalloc wants more thread-local space than a library loaded late is given by default, and
    // the amount is fixed when a process starts.
    if (!getenv("GLIBC_TUNABLES")) {
        setenv("GLIBC_TUNABLES", "glibc.rtld.optional_static_tls=65536", 1);
        execv("/proc/self/exe", argv);
    }
    for (const Allocator& allocator : FindAllocators()) {
        auto add = [&](const char* row, void (*body)(benchmark::State&, const Allocator&)) {
            return benchmark::RegisterBenchmark((std::string(row) + "@" + allocator.m_Name).c_str(),
                                                [=](benchmark::State& s) { body(s, allocator); })
                ->UseRealTime()
                ->RangeMultiplier(4)
                ->Range(16, 1024);
        };
        for (int threads : {1, 2}) {
            add("pair", Pair)->Threads(threads);
            add("live512", Live)->Threads(threads);
            add("burst512", Burst)->Threads(threads);
        }
        add("handover", HandOver);
    }
    return Korvel::Bench::RunComparison(argc, argv);
}

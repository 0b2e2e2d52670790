// A program that uses the pools before their constructor has run and after their destructor has.
// It ends with status 0 if all is well.
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "core/0ReusePool.h"

namespace {

using Korvel::ReusePoolManager;

void* s_Early[3];
void* s_Late[2];

void Expect(bool condition, const char* what) {
    if (condition) return;
    fprintf(stderr, "failed: %s\n", what);
    _exit(1);
}

// To use an object before it is constructed is what this program is about, so the sanitizer's check
// for live objects is off here.
__attribute__((no_sanitize("vptr"))) void* Filled(unsigned long size) {
    void* p = ReusePoolManager::Get().Alloc(size);
    if (p) memset(p, 0xAB, size);
    return p;
}

void BeforeConstructor() {
    const unsigned long sizes[] = {5, 13, 100000};
    for (int i = 0; i < 3; i++) s_Early[i] = Filled(sizes[i]);
}

__attribute__((section(".preinit_array"), used)) void (*const s_Hook)() = BeforeConstructor;

__attribute__((destructor, no_sanitize("vptr"))) void AfterDestructor() {
    ReusePoolManager& pools = ReusePoolManager::Get();
    Expect(pools.GetSize(0) == 0, "no block is left after the destructor");
    for (void* p : s_Late) pools.Free(p);
    pools.Free(Filled(16));
    Expect(pools.GetSize(0) == 0, "late frees go to the system");
}

}  // namespace

int main() {
    ReusePoolManager& pools = ReusePoolManager::Get();
    for (void* p : s_Early) Expect(p != nullptr, "early blocks");
    Expect(pools.GetSize(0) == 0, "nothing is free yet");
    pools.Free(s_Early[0]);
    Expect(pools.GetSize(0) == 0, "a true size of 5 belongs to no class");
    pools.Free(s_Early[1]);
    Expect(pools.GetSize(8) == 24, "a true size of 13 goes into class 1");
    pools.Free(s_Early[2]);
    Expect(pools.Alloc(8) == s_Early[1], "an early block is handed out again");
    pools.Free(s_Early[1]);
    s_Late[0] = Filled(16);
    s_Late[1] = Filled(2000);
    pools.Free(Filled(16));
    return 0;
}

// Recursive mutexes on a futex word.
//
// The C library's would do but for one thing: a thread that is killed just as it gets one leaves it
// locked with nobody to unlock it. Here the step that takes the mutex cannot be interrupted by a
// kill, and a thread that only waits leaves nothing behind.
#include "Platform/Mutex.h"

#include "Platform/MutexInternal.h"
#include "Platform/ThreadInternal.h"

namespace Korvel::Platform {
namespace {

constinit std::atomic<uint64_t> s_LastOwner{0};
constinit thread_local uint64_t t_Owner __attribute__((tls_model("initial-exec"))) = 0;

// The calling thread as an owner. Not its id, which the system gives to another thread some day:
// that one would seem to hold what a killed one has left locked.
uint64_t Self() {
    if (!t_Owner) t_Owner = ++s_LastOwner;
    return t_Owner;
}

}  // namespace

_Mutex* NewMutex(bool initialOwner) {
    NoKill noKill;
    _Mutex* mutex = new _Mutex;
    if (mutex && initialOwner) ObtainMutexGuarded(*mutex, 0);
    return mutex;
}

void DeleteMutex(_Mutex* mutex) {
    NoKill noKill;
    delete mutex;
}

bool ObtainMutexGuarded(_Mutex& mutex, unsigned int timeoutMs) {
    uint64_t self = Self();
    if (mutex.m_Owner.load(std::memory_order_relaxed) == self) {
        mutex.m_Depth++;
        return true;
    }
    if (!mutex.m_Lock.TryObtain()) {
        if (timeoutMs == 0) return false;
        while (!mutex.m_Lock.TryObtainAmongWaiters()) {
            KillableSleep sleep(&mutex.m_Lock.Word());
            mutex.m_Lock.AwaitRelease();
        }
    }
    mutex.m_Owner.store(self, std::memory_order_relaxed);
    mutex.m_Depth = 1;
    return true;
}

bool ObtainMutex(_Mutex* mutex, unsigned int timeoutMs) {
    if (!mutex) return false;
    NoKill noKill;
    return ObtainMutexGuarded(*mutex, timeoutMs);
}

void ReleaseMutex(_Mutex* mutex) {
    if (!mutex) return;
    NoKill noKill;
    if (mutex->m_Owner.load(std::memory_order_relaxed) != Self() || --mutex->m_Depth > 0) return;
    mutex->m_Owner.store(0, std::memory_order_relaxed);
    mutex->m_Lock.Release();
}

void InitCriticalSection(_CriticalSection* section, int) {
    sem_init(&section->m_Semaphore, 0, 0);
    section->m_Owner = 0;
    section->m_Depth = 0;
}

void DeleteCriticalSection(_CriticalSection* section) {
    sem_destroy(&section->m_Semaphore);
}

}  // namespace Korvel::Platform

#include "Platform/Mutex.h"

#include "Platform/MutexInternal.h"
#include "Platform/ThreadInternal.h"

namespace Korvel::Platform {

_Mutex* NewMutex(bool initialOwner) {
    NoKill noKill;
    _Mutex* mutex = new _Mutex;
    if (mutex && initialOwner) pthread_mutex_lock(&mutex->m_Mutex);
    return mutex;
}

void DeleteMutex(_Mutex* mutex) {
    if (!mutex) return;
    NoKill noKill;
    pthread_mutex_destroy(&mutex->m_Mutex);
    delete mutex;
}

bool ObtainMutexGuarded(_Mutex& mutex, unsigned int timeoutMs) {
    int error = pthread_mutex_trylock(&mutex.m_Mutex);
    if (error == EBUSY && timeoutMs) {
        KillableSleep sleep(&mutex.m_Mutex);  // its first word is the one that waiters sleep on
        error = pthread_mutex_lock(&mutex.m_Mutex);
    }
    return error == 0;
}

bool ObtainMutex(_Mutex* mutex, unsigned int timeoutMs) {
    if (!mutex) return false;
    NoKill noKill;
    return ObtainMutexGuarded(*mutex, timeoutMs);
}

void ReleaseMutex(_Mutex* mutex) {
    if (!mutex) return;
    NoKill noKill;
    pthread_mutex_unlock(&mutex->m_Mutex);
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

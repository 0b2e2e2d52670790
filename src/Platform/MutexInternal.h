#pragma once

#include <pthread.h>

#include "Platform/Mutex.h"
#include "core/0ReusePool.h"

namespace Korvel::Platform {

struct _Mutex : Reuser {
    pthread_mutex_t m_Mutex = PTHREAD_RECURSIVE_MUTEX_INITIALIZER_NP;
};

// ObtainMutex for a caller that is inside of one NoKill guard and stays there while it holds the
// mutex. A thread that waits here can be killed, one that has it cannot.
bool ObtainMutexGuarded(_Mutex& mutex, unsigned int timeoutMs);

}  // namespace Korvel::Platform

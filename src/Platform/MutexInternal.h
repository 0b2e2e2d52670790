#pragma once

#include "Platform/FutexInternal.h"
#include "Platform/Mutex.h"
#include "core/0ReusePool.h"

namespace Korvel::Platform {

struct _Mutex : Reuser {
    FutexLock m_Lock;

    // Written by the holder alone. The owner is a number that no other thread ever has, 0 for none.
    std::atomic<uint64_t> m_Owner{0};
    uint32_t m_Depth = 0;
};

// ObtainMutex for a caller that is inside of one NoKill guard and stays there while it holds the
// mutex. A thread that waits here can be killed, one that has it cannot.
bool ObtainMutexGuarded(_Mutex& mutex, unsigned int timeoutMs);

}  // namespace Korvel::Platform

#pragma once

#include <semaphore.h>

#include "core/Export.h"

namespace Korvel::Platform {

struct _Mutex;

// A recursive mutex: its holder may take it again and then has to release it as often.
//
// Threads: only the thread that holds a mutex can release it. A thread that is killed while it
//          holds one holds it for ever; one that is killed while it waits leaves no trace.
// Failure: a null mutex is never obtained, and to release or delete it does nothing.
KORVEL_EXPORT _Mutex* NewMutex(bool initialOwner);  // null when memory has run out
KORVEL_EXPORT void DeleteMutex(_Mutex* mutex);

// True when the calling thread has it.
//   timeoutMs  0 tries and returns at once, 0xFFFFFFFF blocks; there is nothing in between
KORVEL_EXPORT bool ObtainMutex(_Mutex* mutex, unsigned int timeoutMs);
KORVEL_EXPORT void ReleaseMutex(_Mutex* mutex);

// A semaphore with two words beside it, in the caller's memory. It is for hosts alone: there is no
// operation that enters or leaves it.
struct _CriticalSection {
    sem_t m_Semaphore;
    int m_Owner;
    int m_Depth;
};

KORVEL_EXPORT void InitCriticalSection(_CriticalSection* section,
                                       int spinCount);  // count 0, words 0
KORVEL_EXPORT void DeleteCriticalSection(_CriticalSection* section);

}  // namespace Korvel::Platform

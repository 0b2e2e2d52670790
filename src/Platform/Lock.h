#pragma once

#include "core/Annotations.h"
#include "core/Export.h"

namespace Korvel::Platform {
struct _Mutex;
}

namespace Korvel::KorvelScript {

// A recursive mutex as an object. AutoLock is the usual way to hold it.
//
// Failure: without the memory for its mutex a lock cannot be obtained: ObtainLock is false for
// good.
class KORVEL_EXPORT KORVEL_CAPABILITY("lock") Lock {
public:
    Lock();
    Lock(const Lock&) = delete;
    Lock& operator=(const Lock&) = delete;
    virtual ~Lock();  // nobody may hold it

    bool ObtainLock();     // blocks; true when the calling thread has it
    bool TryObtainLock();  // does not wait; false while another thread has it
    void ReleaseLock();    // one level, by the thread that has it

private:
    Platform::_Mutex* m_Mutex;
};

// Holds a lock until the end of its scope. When the lock cannot be obtained it holds nothing.
class KORVEL_SCOPED_CAPABILITY AutoLock {
public:
    explicit AutoLock(Lock& lock) KORVEL_ACQUIRE(lock)
        : m_Lock(lock.ObtainLock() ? &lock : nullptr) {}
    AutoLock(const AutoLock&) = delete;
    AutoLock& operator=(const AutoLock&) = delete;
    ~AutoLock() KORVEL_RELEASE() {
        if (m_Lock) m_Lock->ReleaseLock();
    }

private:
    Lock* m_Lock;
};

}  // namespace Korvel::KorvelScript

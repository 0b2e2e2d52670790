#include "Platform/Lock.h"

#include "Platform/Events.h"
#include "Platform/Mutex.h"
#include "core/SpinLockInternal.h"

namespace Korvel::KorvelScript {

Lock::Lock() : m_Mutex(Platform::NewMutex(false)) {}
Lock::~Lock() {
    Platform::DeleteMutex(m_Mutex);
}

bool Lock::ObtainLock() {
    LockPlace::AssertMoreMayCome();
    return Platform::ObtainMutex(m_Mutex, Platform::kNoTimeLimit);
}
bool Lock::TryObtainLock() {
    return Platform::ObtainMutex(m_Mutex, 0);
}
void Lock::ReleaseLock() {
    Platform::ReleaseMutex(m_Mutex);
}

}  // namespace Korvel::KorvelScript

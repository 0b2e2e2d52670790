#pragma once

namespace Korvel::Platform {

struct _Event;

// Sets the event as SetEvent does, but for its last step: FutexWake of one sleeper on the result,
// unless that is null. A caller that holds a lock which the waiter is going to want takes that step
// after it has let go of the lock; otherwise the waiter may wake up only to sleep on the lock. The
// event may be gone by then.
[[nodiscard]] const void* SetEventQuietly(_Event* event);

}  // namespace Korvel::Platform

#pragma once

#include "core/Export.h"

// Events that threads wait for: a flag that one side sets and the other waits on.
//
// A manual-reset event stays set until ResetEvent and lets every waiter through; an auto-reset
// event lets one wait through, which clears it. Signals do not add up.
//
// Threads: any thread may use any event. An event may be deleted as soon as the wait that needed it
//          has returned, but not while somebody waits, a waiter that was killed excepted.
// Failure: on a null event nothing happens, and a wait is false at once.
namespace Korvel::Platform {

struct _Event;

// The time-out of a wait without a limit; other time-outs are milliseconds.
constexpr unsigned int kNoTimeLimit = 0xFFFFFFFF;

// The caller owns the event until DeleteEvent. Null when memory has run out.
KORVEL_EXPORT _Event* NewEvent(bool manualReset, bool initialState);
KORVEL_EXPORT void DeleteEvent(_Event* event);  // null is accepted

// Sets the flag and wakes the waiters of a manual-reset event, or one of an auto-reset one.
KORVEL_EXPORT void SetEvent(_Event* event);
KORVEL_EXPORT void ResetEvent(_Event* event);

// Sets the flag and clears it again. A waiter that does not look in between sleeps on; to rely on
// it is to lose wake-ups.
KORVEL_EXPORT void PulseEvent(_Event* event);

// True when the event was set; that clears an auto-reset event.
//   timeoutMs  0 never blocks, not even on another thread that has the event in hand just then: the
//              answer is false, set or not. The limit is on the wall clock.
KORVEL_EXPORT bool WaitEvent(_Event* event, unsigned int timeoutMs);

// Waits for one event after the other, with the whole time-out for each, and gives up at the first
// that fails. True for no events.
KORVEL_EXPORT bool WaitAllEvents(unsigned int count, _Event** events, unsigned int timeoutMs);

}  // namespace Korvel::Platform

#pragma once

#include "core/Export.h"

// Threads of the operating system behind counted handles.
//
// A handle from NewThread has two holders: its creator, until DeleteThread, and the running body,
// until it ends. So either side may finish first. Every function may be called from any thread that
// holds a reference, and no handle may be null where nothing else is said.
namespace Korvel::Platform {

struct _Thread;

using ThreadEntry = unsigned long long (*)(void* argument);

// From 0, the lowest, to 6, the highest.
using ThreadPri = unsigned int;
constexpr ThreadPri kDefaultThreadPri = 3;

// Bits of NewThread's flags; the others have no meaning.
constexpr unsigned int kThreadSuspended = 1;  // the body does not start before ResumeThread

// Starts a thread with the C locale and, on x86, with denormal numbers flushed to zero.
//   idOut    takes the thread's id before the body starts; may be null
//   returns  the handle, the caller's until DeleteThread; null when there is no memory or no thread
KORVEL_EXPORT _Thread* NewThread(ThreadEntry entry, void* argument, unsigned int flags,
                                 unsigned long long* idOut);

// A record with no thread behind it: with an event it has two references and a quit event, else one
// reference. Null when memory has run out.
KORVEL_EXPORT _Thread* CreateThreadStruct(bool withEvent);

// Drops a reference; null is accepted. It never stops a thread. The last holder detaches a thread
// that nobody has joined.
KORVEL_EXPORT void DeleteThread(_Thread* thread);

// Lets a body start that NewThread was told to hold back. True whatever happens.
KORVEL_EXPORT bool ResumeThread(_Thread* thread);

// Has no effect on a thread that runs. Always true.
KORVEL_EXPORT bool SuspendThread(_Thread* thread);

// Waits for the end of the body and for the thread to be gone. An adopted thread has no end of a
// body to wait for: it is joined, however long that takes, so nobody else may join it.
//   timeoutMs  0 only looks, 0xFFFFFFFF has no limit
//   returns    false when the body has not ended in time; with 0 perhaps also while another thread
//              looks at the same moment
KORVEL_EXPORT bool WaitThread(_Thread* thread, unsigned int timeoutMs);

// True once the thread is gone, a little later than the end of its body.
KORVEL_EXPORT bool HasThreadQuit(_Thread* thread);

// True when all threads are gone within the time. `timeoutMs` 0 is false even for no threads at
// all; 0xFFFFFFFF has no limit. With a limit it looks each 10 milliseconds.
KORVEL_EXPORT bool WaitAllThreads(unsigned int count, _Thread** threads, unsigned int timeoutMs);

// Ends a thread in the middle of what it does: nothing is unwound, no destructor runs, and what it
// holds it holds for ever. Last resort; docs/threads.md tells what remains whole.
//
// The thread ends at its first moment outside of the library's own short critical stretches; after
// a second without such a moment the call gives up. The thread is joined, its quit event set and
// its body's reference dropped. A thread may kill itself; then the call does not return.
//   exitCode  not used
//   returns   true when the thread is gone; false, with nothing done, for null, for threads that
//             NewThread has not made, and when the kill signal is in use by somebody else
KORVEL_EXPORT bool KillThread(_Thread* thread, unsigned int exitCode);

// Moves KillThread to another signal than SIGRTMIN + 6. False when it is too late, that is after
// the first NewThread, and for a number that cannot be handled.
KORVEL_EXPORT bool SetKillSignal(int signalNumber);

// The system-wide id of a thread, unique among live threads and not 0; 0 for a record without one.
KORVEL_EXPORT unsigned long long GetThreadID(_Thread* thread);

// The calling thread's id. A thread that NewThread has not made is adopted first.
KORVEL_EXPORT unsigned long long GetCurrentThreadID();

// The calling thread's handle, borrowed, adopting as above. An adopted thread's handle ends with
// the thread. Null when memory has run out or the thread is past its body.
KORVEL_EXPORT _Thread* GetCurrentThread();

// Gives the calling thread a record and an id, unless it has a record. Not for exit handlers of
// threads: nobody would drop the record.
KORVEL_EXPORT void _SetCurrentThread();

// Sets the calling thread's locale and number handling as NewThread does, for threads of the host.
KORVEL_EXPORT void InitThread();

// Spreads the scale over the limits of the thread's scheduling policy. Values above 6, priorities
// that the system does not allow and threads that are gone change nothing.
KORVEL_EXPORT void SetThreadPriority(_Thread* thread, ThreadPri priority);

// The way back, rounded; the default where the policy knows one priority only.
KORVEL_EXPORT ThreadPri GetThreadPriority(_Thread* thread);

// Names the calling thread, in at most 15 bytes of UTF-8. The second argument is not used.
KORVEL_EXPORT void SetThreadName(const char* name, _Thread* thread);

// The number of processors in use, at least 1.
KORVEL_EXPORT unsigned int GetIdealThreadCount();

// These have no effect, and the two questions answer 0.
KORVEL_EXPORT void SetThreadIdealProcessor(_Thread* thread, unsigned int processor);
KORVEL_EXPORT unsigned int GetThreadIdealProcessor(_Thread* thread);
KORVEL_EXPORT unsigned int GetThreadExitCode(_Thread* thread);

}  // namespace Korvel::Platform

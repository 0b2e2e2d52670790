#pragma once

// What clang's thread safety analysis (-Wthread-safety) is told about locks; nothing for others.
//
// The analysis looks at one function at a time and does not know recursion. Our locks are
// recursive, so Lock::ObtainLock itself carries no annotation and only the guard AutoLock does: a
// function that holds a lock may call another one that takes it again. A function marked
// KORVEL_REQUIRES has the lock already and does not make a second guard.
#ifdef __clang__
#define KORVEL_ANNOTATE(x) __attribute__((x))
#else
#define KORVEL_ANNOTATE(x)
#endif

// For a class of locks, and for a class of guards.
#define KORVEL_CAPABILITY(name) KORVEL_ANNOTATE(capability(name))
#define KORVEL_SCOPED_CAPABILITY KORVEL_ANNOTATE(scoped_lockable)

// For a field, and for what a pointer field points at.
#define KORVEL_GUARDED_BY(lock) KORVEL_ANNOTATE(guarded_by(lock))
#define KORVEL_PT_GUARDED_BY(lock) KORVEL_ANNOTATE(pt_guarded_by(lock))

// For a function: its caller holds the locks; it takes them; it lets them go.
#define KORVEL_REQUIRES(...) KORVEL_ANNOTATE(requires_capability(__VA_ARGS__))
#define KORVEL_ACQUIRE(...) KORVEL_ANNOTATE(acquire_capability(__VA_ARGS__))
#define KORVEL_RELEASE(...) KORVEL_ANNOTATE(release_capability(__VA_ARGS__))

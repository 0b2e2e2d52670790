#pragma once

namespace Korvel::Platform {

// Starts a program that this process leaves to itself: it is no child of this process, has a
// session of its own and neither its streams nor any other descriptor. False, with errno set, when
// that fails; a program that cannot be executed goes unnoticed.
bool StartDetached(const char* program, const char* argument, const char* folder);

// Whether a child still runs; it is not waited for. ReapChild does that for one that has ended, and
// so gives its id back to the system.
bool IsChildRunning(unsigned long long id);
void ReapChild(unsigned long long id);

}  // namespace Korvel::Platform

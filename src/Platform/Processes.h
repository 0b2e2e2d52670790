#pragma once

#include "core/Export.h"
#include "core/OxString.h"

namespace Korvel::Platform {

// Makes the process fit for many connections; for the start of a program. It lets it open at least
// 10000 files, as far as the system allows it, ignores SIGPIPE and clears the umask.
KORVEL_EXPORT void InitProcess();

// The process environment, one block for all threads. Whoever walks it does so between the two
// lock operations; GetEnv and PutEnv take the lock themselves. The lock nests.
KORVEL_EXPORT char** GetEnviron();
KORVEL_EXPORT void ObtainEnvLock();
KORVEL_EXPORT void ReleaseEnvLock();

// Copies the value of the first variable whose name is `name`, the case of letters set aside.
// Returns false, and leaves `value` alone, when there is none. A value that begins with byte 0xFF,
// which no text may, gets a '?' in its place. Without the memory for a copy it is false, too.
KORVEL_EXPORT bool GetEnv(const char* name, OxStringT<char>& value);

// Puts "NAME=value" into the environment, or takes NAME out of it when `setting` has no '='. The
// text is copied and the copy kept for as long as the process lives. Returns false for a null or
// empty text and when memory has run out. To tell the settings of EnvVar, call InvalidateEnv.
KORVEL_EXPORT bool PutEnv(const char* setting);

// A fresh random UUID as 36 characters of lower-case text, in a block of 40 bytes of the C heap
// that DeleteUUID frees. Null when there is no memory or no randomness.
KORVEL_EXPORT char* NewUUID();
KORVEL_EXPORT void DeleteUUID(char* uuid);

}  // namespace Korvel::Platform

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

// Another process, as a handle: its id, widened. It owns nothing.
struct _Process;

// Starts a program with this process's environment and its three standard streams. The caller waits
// for it, or it stays behind when it has ended.
//   commandLine  the program and its arguments, cut at blanks: each blank ends an argument, even an
//                empty one. From a double quote to the next one blanks are text, and the second one
//                ends the argument and takes a blank behind it along. A first one is left out where
//                it begins an argument; elsewhere it is text.
//   folder       the working directory of the program, whose name is then a path from there. With
//                null it is this process's own; a name without a slash is also looked for in PATH
//   flags        not used
//   idOut        takes the id; may be null
//   returns      null, with errno set, when it cannot be started
KORVEL_EXPORT _Process* NewProcess(const char* commandLine, const char* folder, unsigned int flags,
                                   unsigned long long* idOut);
// Waits for the end of a child, without a limit, and gives its exit status; 0 when a signal has
// ended it, 0xFFFFFFFF for null and for what is no child.
KORVEL_EXPORT unsigned int WaitProcess(_Process* process, unsigned int timeoutMs);
KORVEL_EXPORT void DeleteProcess(_Process* process);  // nothing: it goes on

KORVEL_EXPORT unsigned long long GetCurrentProcessID();
KORVEL_EXPORT _Process* GetCurrentProcess();
KORVEL_EXPORT unsigned long long GetProcessID(_Process* process);

// The first process of a name, of which the system keeps 15 bytes; 0 when there is none.
KORVEL_EXPORT unsigned long long FindProcessID(const char* name);
// Kills a process. False for 0 and when it may not, or there is none.
KORVEL_EXPORT bool TerminateProcessID(unsigned long long id);

// A fresh random UUID as 36 characters of lower-case text, in a block of 40 bytes of the C heap
// that DeleteUUID frees. Null when there is no memory or no randomness.
KORVEL_EXPORT char* NewUUID();
KORVEL_EXPORT void DeleteUUID(char* uuid);

}  // namespace Korvel::Platform

#pragma once

#include <cstdio>

#include "Platform/Files.h"
#include "Platform/Lock.h"
#include "core/Export.h"

namespace Korvel {

// A text log that only grows, one file for each process.
//
// The environment variable `envName` switches it: "true", in any case, turns it on and any other
// value off; without it `defaultOn` decides. The file is `baseName` with "_", the process id and
// ".log" behind it. A second log of the same name appends to the same file. Each log begins with a
// header that tells the local time.
//
// Threads: any. A thread that is killed while it prints finishes its entry first.
// Failure: a log whose file cannot be opened is off, and prints nothing.
class KORVEL_EXPORT DebugLog : public KorvelScript::Lock {
public:
    // The name of the variable is not copied.
    DebugLog(const char* envName, const char* baseName, bool defaultOn);
    ~DebugLog() override;  // closes the file

    // Appends one entry, as it stands in the file when the call returns: the milliseconds of
    // GetUpTime and the thread's id, the low 32 bits of each, and the text. The text brings its own
    // line end.
    void PrintF(const char* format, ...) KORVEL_PRINTF(2, 3);

private:
    bool IsSwitchedOn() const;

    // Fixed after construction
    FILE* m_Stream;  // null when the log is off
    const char* m_EnvName;
    char m_FileName[Platform::kMaxPath];
    bool m_DefaultOn;
};

// The log of connections and of the script server, switched on by OXSCRIPT_LOG_SERVER. It may be
// used at any time: before the library's static initialisers have run it is off, and it is not
// closed at exit.
KORVEL_EXPORT extern DebugLog& g_ScriptServerLog;

}  // namespace Korvel

#include <cstdio>

#include "Platform/NoKillInternal.h"
#include "core/ScriptHooksInternal.h"

namespace Korvel {

constinit ScriptHooks g_ScriptHooks;

void ScriptHooks::LogToStandardError(const char* line) {
    Platform::NoKill noKill;
    fprintf(stderr, "korvelscript: %s\n", line);
}

}  // namespace Korvel

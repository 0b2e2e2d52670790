#pragma once

#include "core/Export.h"

namespace Korvel {

// The script server of a machine: the registry of its hosts.

// The port, TCP and UDP, at which the script server is reached. KORVEL_ScriptServerPort or 1144 at
// first; for a program to change before it uses scripting.
KORVEL_EXPORT extern unsigned int g_ScriptServerPort;
// How many rounds of its main loop, a tenth of a second each, a server waits for its first
// connection; 0xFFFFFFFF is for ever. KORVEL_ScriptServerExitDelay or 300 at first.
KORVEL_EXPORT extern unsigned int g_ScriptServerExitDelay;

}  // namespace Korvel

// Runs the script server of this machine until it has nobody to serve.
extern "C" KORVEL_EXPORT void ScriptServerMain();

#pragma once

#include "core/Export.h"

extern "C" {

// Runs a Lua file in a fresh interpreter with all libraries and the arguments `argv` (texts up to a
// null pointer, see SetArgs; numbered from 1), on the caller's thread. Errors go to standard error.
//   returns  the script's first result if it is a number, cut to an integer, else 0;
//            -1 when the script failed or called os.exit; -2 when the file could not be loaded
KORVEL_EXPORT int RunScript(const char* file, char** argv);

}  // extern "C"

#pragma once

#include "core/Export.h"

struct lua_State;

extern "C" {

// Opens the host library in an interpreter: the tables `orv` and `ondry`, which hold the same
// functions, and an `os.exit` that ends the script instead of the process. It is what
// `require "krscript"` calls, also in an interpreter that is not ours, so it keeps to the Lua 5.1
// interface. Returns the table `orv`. Raises Lua errors when memory runs out.
KORVEL_EXPORT int luaopen_krscript(lua_State* L);

}  // extern "C"

namespace Korvel {

class TagList;

// Opens the standard libraries, LPeg (also as the global `lpeg`) and the host library, and leaves
// the stack empty. The list is not used. Raises Lua errors, so call it protected.
KORVEL_EXPORT void OpenAllLibs(lua_State* L, TagList* tags = nullptr);

// The counterpart of OpenAllLibs; there is nothing to do.
KORVEL_EXPORT void CloseAllLibs(lua_State* L, TagList* tags = nullptr);

// Closes an interpreter with all that it holds, one at a time in the process. What it loaded may
// not be safe to unload side by side.
KORVEL_EXPORT void CloseInterpreter(lua_State* L);

// Calls the Lua global `require` with a name and, with `setGlobal`, stores the result as the global
// of that name. A failure is dropped; the global is then not set.
KORVEL_EXPORT void require(lua_State* L, const char* name, bool setGlobal);

// Sets the global `arg` from texts that end with a null pointer; `argv` itself may be null. An
// entry "key=value" goes under its key, any other under the next number, from `first` on; `arg.n`
// is the last number given. Raises Lua errors, so call it protected.
KORVEL_EXPORT void SetArgs(lua_State* L, char** argv, int first);

}  // namespace Korvel

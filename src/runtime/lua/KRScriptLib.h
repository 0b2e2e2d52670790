#pragma once

#include "core/Export.h"

struct lua_State;

extern "C" {

// Opens the host library in an interpreter: the tables `orv` and `ondry`, which hold the same
// functions, an `os.exit` that ends the script instead of the process, the globals of older
// scripts, and globals that are members of the active object. It is what `require "krscript"`
// calls, also in an interpreter that is not ours, so it keeps to the Lua 5.1 interface. A process
// without a configuration gets one, of a client by the name of "korvelscript", and scripting is
// started with it. Returns the table `orv`. Raises Lua errors when memory runs out.
KORVEL_EXPORT int luaopen_krscript(lua_State* L);

}  // extern "C"

namespace Korvel {

class TagList;

// Opens the standard libraries, LPeg (also as the global `lpeg`) and the host library, which
// `require "krscript"` gives as well, lets `require` find the modules of the resource store, and
// leaves the stack empty. The list is not used. For an interpreter that has not run anything.
// Raises Lua errors, so call it protected, and close an interpreter where it has failed.
KORVEL_EXPORT void OpenAllLibs(lua_State* L, TagList* tags = nullptr);

// The counterpart of OpenAllLibs; there is nothing to do.
KORVEL_EXPORT void CloseAllLibs(lua_State* L, TagList* tags = nullptr);

// Closes an interpreter with all that it holds, one at a time in the process. What it loaded may
// not be safe to unload side by side.
KORVEL_EXPORT void CloseInterpreter(lua_State* L);

// Calls the Lua global `require` with a name and, with `setGlobal`, stores the result as the global
// of that name. A failure is dropped; the global is then not set.
KORVEL_EXPORT void require(lua_State* L, const char* name, bool setGlobal);

// Sets a search path of `require`: `field` of the table `package`, which is "path" or "cpath".
// Where the environment has a variable `envName`, that is taken, with `value` between the two signs
// of each ";;"; else `value` itself. A "!" stands for the folder of this library, with its slash.
// Raises Lua errors, so call it protected.
KORVEL_EXPORT void SetLuaPath(lua_State* L, const char* field, const char* envName,
                              const char* value);

// Sets the global `arg` from texts that end with a null pointer; `argv` itself may be null. An
// entry "key=value" goes under its key, any other under the next number, from `first` on; `arg.n`
// is the last number given. Raises Lua errors, so call it protected.
KORVEL_EXPORT void SetArgs(lua_State* L, char** argv, int first);

}  // namespace Korvel

#pragma once

struct lua_State;

namespace Korvel {

class ScriptVal;

// Code as values: a function of Lua in the bytes that this interpreter, and no other kind, can
// load.

// Sets a value to the code of the function at an index; to nil where that is native. False when
// memory has run out.
bool ReadCode(lua_State* L, int index, ScriptVal& value);

// Whether code may be run: what came over a connection from another process may be only where
// KORVEL_AllowRemoteCode is set. Code of this process that has come back counts as that process's.
bool MayRunCode(const ScriptVal& code);

// Runs the code and pushes `numResults` results, or all with LUA_MULTRET. Code that fails is told
// to the global _ALERT: then the one result is nil.
void PushCodeResults(lua_State* L, const ScriptVal& code, int numResults);

}  // namespace Korvel

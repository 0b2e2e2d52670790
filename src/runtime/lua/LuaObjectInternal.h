#pragma once

#include <cstdint>

struct lua_State;

namespace Korvel {

class RemoteApp;
class RemoteObject;
class ScriptVal;

// What the conversion of values needs of objects. All but ReadObject may raise Lua errors.

// The object of the userdata at an index, which keeps it alive; null for anything else.
RemoteObject* ToScriptObject(lua_State* L, int index);

// Sets a value to the object: to a local one where it is of this process.
void ReadObject(RemoteObject* object, ScriptVal& value);

// Pushes the userdata of an object of this process; the value holds it. Each connection has a
// userdata of its own, as commands leave their errors there.
void PushLocalObject(lua_State* L, RemoteApp* app, const ScriptVal& value);

// Pushes a function value.
//   flags  those of the value, without its type
void PushFunction(lua_State* L, uint64_t function, uint32_t flags);

}  // namespace Korvel

#pragma once

#include "core/Export.h"
#include "core/ScriptVal.h"

struct lua_State;

namespace Korvel {

class TagList;

// How values pass between native code and Lua.
//
// Both directions work on the state's thread and may raise Lua errors, so they are called protected
// (lua_pcall, lua_cpcall). They hold nothing while they can raise one: what FromLua has converted
// so far stands in the caller's value, and is no more than fit to be released. They leave nothing
// on the stack but their results. A callback that throws a std::exception raises a Lua error with
// its text.
// Values nest at most kMaxNesting deep; beyond that they raise "Table nested too deeply.".
// An ordered table is one whose metatable is the global `_orderedtable_meta`. It is made by the
// function `table.ordered`, without which it becomes a plain one, and read by the iterator
// `_orderedtable_next`. These three are looked up as they stand, past any metatable.

// Converts a value itself when it returns true: leaves one value on top of the stack, or sets
// `value`. The callbacks of the configuration are asked after it, for keys too.
using ToLuaFunc = bool (*)(RemoteApp* app, lua_State* L, ScriptVal& value, void* user);
using FromLuaFunc = bool (*)(lua_State* L, int index, ScriptVal& value, void* user);

// Bits of FromLua's flags.
constexpr unsigned int FROMLUA_Consume = 0x1;  // empties the table as it is read, to save memory

// Pushes a value; false, with nothing pushed, for what Lua cannot hold and for a block of bytes
// without memory. A table gets its constructor and its flags as `__ctor` and `__flags`, read-only
// excepted, and loses what Lua has no key or no value for.
KORVEL_EXPORT bool ToLua(RemoteApp* app, lua_State* L, ScriptVal& value, ToLuaFunc callback,
                         void* user, unsigned int flags, TagList* tags = nullptr);

// Pushes the results of a call, from key −1 down to the lowest number key, and returns how many
// they are. Those that are missing are nils; keys below −255 are left out.
KORVEL_EXPORT int ToLuaRet(RemoteApp* app, lua_State* L, ScriptVal& value, ToLuaFunc callback,
                           void* user, unsigned int flags);

// Sets `value` from the value at `index`; a read-only one stays as it is. Number keys come first,
// in ascending order, then the others as they come. A text with a NUL, or that begins with byte
// 0xFF, becomes a block of bytes. A text `__ctor` and a number `__flags` become the constructor and
// the flags of their table, where they have another type nothing. Raises "Unsupported type for
// custom data!" for what a value cannot hold, and for a key or constructor that begins with 0xFF.
// False when memory has run out; `value` then has what came before.
KORVEL_EXPORT bool FromLua(lua_State* L, int index, ScriptVal& value, FromLuaFunc callback,
                           void* user, unsigned int flags);

// The same with no callback, no flags and no connection.
KORVEL_EXPORT bool lua_toscriptval(lua_State* L, int index, ScriptVal& value);
KORVEL_EXPORT bool lua_pushscriptval(lua_State* L, ScriptVal& value);

// Defines the globals of byte blocks. Each gives one block, or no result where the argument is
// another one or there is no memory.
//   MemBlock(n)    n zero bytes, 1 up to what 32 bits hold
//   HexData(text)  the bytes of hexadecimal numbers between white space, up to the first thing that
//                  is no number; of a number above 0xFF the low byte
// A block `b` has bytes b[1] to b[b.Size] to read and to assign; other keys read nil, assignments
// to them, and of what is no number, do nothing. It is a userdata that holds a pointer to a
// `MemBlock`, and owns that and the bytes, both from the pool.
void register_memblock(lua_State* L);

}  // namespace Korvel

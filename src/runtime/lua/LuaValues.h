#pragma once

#include "core/Export.h"
#include "core/MemBlock.h"
#include "core/ScriptVal.h"

struct lua_State;

namespace Korvel {

class OxID;
class TagList;

// How values pass between native code and Lua.
//
// Both directions work on the state's thread and may raise Lua errors, so they are called protected
// (lua_pcall, lua_cpcall). They hold nothing while they can raise one: what FromLua has converted
// so far stands in the caller's value, and is no more than fit to be released. They leave nothing
// on the stack but their results. A callback that throws a std::exception raises a Lua error with
// its text.
// Values nest at most kMaxNesting deep, and what stands in a table, attributes and all, takes at
// most as many bytes as a packet may have; beyond that they raise "Table nested too deeply.".
// An ordered table is one whose metatable is the global `_orderedtable_meta`. It is made by the
// function `table.ordered`, without which it becomes a plain one, and read by the iterator
// `_orderedtable_next`. These three are looked up as they stand, past any metatable. The fields in
// which its order stands, `__idxtokey` and `__keytoidx`, are not set from a value's entries.

// Converts a value itself when it returns true: leaves one value on top of the stack, or sets
// `value`. The callbacks of the configuration are asked after it, for keys too.
using ToLuaFunc = bool (*)(RemoteApp* app, lua_State* L, ScriptVal& value, void* user);
using FromLuaFunc = bool (*)(lua_State* L, int index, ScriptVal& value, void* user);

// Bits of FromLua's flags.
constexpr unsigned int FROMLUA_Consume = 0x1;  // empties the table as it is read, to save memory

// Bits of ToLua's flags.
constexpr unsigned int TOLUA_AskPeer = 0x2;  // a local object is what the peer has at its address

// Pushes a value; false, with nothing pushed, for what Lua cannot hold and for a block of bytes
// without memory. A table gets its constructor and its flags, without read-only, as `__ctor` and
// `__flags`, and loses what Lua has no key or no value for. An object becomes its userdata (see
// LuaObject.h); a local one needs the connection `app` and is nil without it. A function becomes
// one that is called with an object. Code is run, and its results are pushed: all of them, or just
// one inside of a table and in ToLuaRet. The result is nil where it fails, which is told to the
// global _ALERT, and for code that came over a connection from another process, which is told to
// the log once in each conversion, unless KORVEL_AllowRemoteCode is set.
KORVEL_EXPORT bool ToLua(RemoteApp* app, lua_State* L, ScriptVal& value, ToLuaFunc callback,
                         void* user, unsigned int flags, TagList* tags = nullptr);

// Pushes the results of a call, from key −1 down to the lowest number key, and returns how many
// they are. Those that are missing are nils; keys below −255 are left out.
KORVEL_EXPORT int ToLuaRet(RemoteApp* app, lua_State* L, ScriptVal& value, ToLuaFunc callback,
                           void* user, unsigned int flags);

// Sets `value` from the value at `index`; a read-only one stays as it is. Number keys come first,
// in ascending order, then the others as they come. A step of the walk over a table that raises an
// error ends it. A text with a NUL, or that begins with byte 0xFF, becomes a block of bytes. A text
// `__ctor` and a number `__flags` become the constructor and the flags of their table; of any other
// type they are dropped. A function becomes its code, a native one nil.
// Raises "Unsupported type for custom data!" for what a value cannot hold, for a text key that
// begins with 0xFF, and for a constructor that does or has a NUL. False when memory has run out;
// `value` then has what came before.
KORVEL_EXPORT bool FromLua(lua_State* L, int index, ScriptVal& value, FromLuaFunc callback,
                           void* user, unsigned int flags);

// The same with no callback, no flags and no connection.
KORVEL_EXPORT bool lua_toscriptval(lua_State* L, int index, ScriptVal& value);
KORVEL_EXPORT bool lua_pushscriptval(lua_State* L, ScriptVal& value);

// Compile a text or a file to code, without its names and lines. Null, with the message in `error`,
// when that fails; else a record that is the caller's, as are the bytes: both are given back to
// g_ReusePoolMgr. The list is not used.
KORVEL_EXPORT MemBlock* lua_StrToCode(const char* text, OxID& error, TagList* tags);
KORVEL_EXPORT MemBlock* lua_FileToCode(const char* file, OxID& error, TagList* tags);

// Defines the globals of byte blocks. Each gives one block, or no result where the argument is
// another one or there is no memory.
//   MemBlock(n)    n zero bytes, 1 up to what 32 bits hold
//   HexData(text)  the bytes of hexadecimal numbers with white space between them, up to where
//                  anything else stands; of a number above 0xFF the low byte
// A block `b` has bytes b[1] to b[b.Size] to read and to assign; other keys read nil, assignments
// to them, and of what is no number, do nothing. It is a userdata that holds a pointer to a
// `MemBlock`, and owns that and the bytes, both from the pool.
void register_memblock(lua_State* L);

}  // namespace Korvel

#pragma once

#include <atomic>
#include <lua.hpp>
#include <string>

#include "core/TextCellInternal.h"

// The parts of the host library. All of it keeps to the Lua 5.1 interface, may raise Lua errors,
// and holds no object with a destructor across a call that can: in an interpreter that is not ours
// such an error is a long jump.
namespace Korvel {

// The functions `using` and `getusing` of scripts: exchange and read the active object, whose
// members can be used like globals.
int activeobj(lua_State* L);
int getactiveobj(lua_State* L);

// The functions by which scripts reach other processes, up to a null.
extern const luaL_Reg kRemoteFunctions[];

// Installs a configuration of the library's own where there is none, and starts scripting with it:
// a client that nobody can call.
void EnsureConfig();

// Whether the globals are looking a name up in the active object: then it is only tried.
bool IsProbe(lua_State* L);

// Makes the globals look up in the active object what they do not have. A metatable that the
// globals have got already stays, with another __index.
void SetGlobalIndex(lua_State* L);

// A Lua text of the library. The first interpreter of the process compiles it, all others load the
// bytecode, which stays for the life of the process. Compiling and loading is of the same Lua,
// because the process has bound our calls to one.
class EmbeddedScript {
public:
    constexpr explicit EmbeddedScript(const char* text) : m_Text(text) {}

    // What luaL_loadstring does. From several threads at once, each with an interpreter of its own.
    int Load(lua_State* L);

private:
    void KeepBytecode(lua_State* L);

    const char* m_Text;
    std::atomic<const std::string*> m_Bytecode = nullptr;
};

// Tells the message on top of the stack to the global _ALERT, if there is one, and pops it.
void Alert(lua_State* L);

// Defines ordered tables: `table.ordered`, `_orderedtable_meta` and `_orderedtable_next`.
void RunOrderedTableScript(lua_State* L);

// Runs the scripts that belong to the library. One that fails is told to the global _ALERT, and the
// next one has its turn.
void RunStartupScripts(lua_State* L);

// The module searcher for the resource store, a function of package.loaders.
int myloader(lua_State* L);

// The text at an absolute index, fit for the host: no plain text begins with the marker of a text
// cell. Null for what is no text.
inline const char* PlainText(lua_State* L, int index) {
    const char* text = lua_tostring(L, index);
    if (!TextCell::IsCell(text)) return text;
    lua_pushfstring(L, "%c%s", TextCell::SafeFirstByte(*text), text + 1);
    lua_replace(L, index);
    return lua_tostring(L, index);
}

// Globals as they are, past anything that a script has put into the globals' metatable.
inline void PushGlobalRaw(lua_State* L, const char* name) {
    lua_pushstring(L, name);
    lua_rawget(L, LUA_GLOBALSINDEX);
}
inline void SetGlobalRaw(lua_State* L, const char* name) {  // to the value on top, which it pops
    lua_pushstring(L, name);
    lua_insert(L, -2);
    lua_rawset(L, LUA_GLOBALSINDEX);
}

}  // namespace Korvel

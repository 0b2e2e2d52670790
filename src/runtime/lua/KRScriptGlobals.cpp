// The active object of an interpreter, and the globals that are its members.
#include "runtime/lua/KRScriptLibInternal.h"

namespace Korvel {
namespace {

// Keys of the registry.
constexpr char kActiveObject[] = "KorvelScriptActiveObject";
constexpr char kIgnoreErrors[] = "KorvelScriptIgnoreErrors";

// An active object that itself looks into the globals would come back here for ever, and native
// stack runs out sooner than Lua's.
constexpr int kMaxDepth = 100;
thread_local int t_Depth = 0;

// A member of the active object called like a function: puts the object in front of the arguments.
int globcall(lua_State* L) {
    lua_pushvalue(L, lua_upvalueindex(1));
    lua_insert(L, 1);
    lua_pushvalue(L, lua_upvalueindex(2));
    lua_insert(L, 2);
    lua_call(L, lua_gettop(L) - 1, LUA_MULTRET);
    return lua_gettop(L);
}

int Index(lua_State* L) {
    lua_gettable(L, 1);
    return 1;
}

// Tells remote objects that a name is only tried. The key has its place in the registry from the
// first time on, so taking the flag back cannot fail.
void SetIgnoreErrors(lua_State* L, bool ignore) {
    lua_pushboolean(L, ignore);
    lua_setfield(L, LUA_REGISTRYINDEX, kIgnoreErrors);
}

// __index of the globals. Its upvalue is the function Index, so that a look-up makes no garbage.
int global_index(lua_State* L) {
    lua_settop(L, 2);
    lua_pushvalue(L, 2);
    lua_rawget(L, LUA_GLOBALSINDEX);
    if (!lua_isnil(L, -1)) return 1;
    getactiveobj(L);
    if (lua_isnil(L, -1)) return 1;
    if (t_Depth >= kMaxDepth) return luaL_error(L, "the active object looks itself up for ever");

    lua_getfield(L, LUA_REGISTRYINDEX, kIgnoreErrors);
    bool isProbe = !lua_toboolean(L, -1);
    if (isProbe) SetIgnoreErrors(L, true);
    lua_pushvalue(L, lua_upvalueindex(1));
    lua_pushvalue(L, 4);
    lua_pushvalue(L, 2);
    t_Depth++;
    int status = lua_pcall(L, 2, 1, 0);
    t_Depth--;
    if (isProbe) SetIgnoreErrors(L, false);
    if (status != 0) return lua_error(L);
    if (!lua_iscfunction(L, -1)) return 1;
    lua_pushvalue(L, 4);
    lua_pushcclosure(L, globcall, 2);
    return 1;
}

}  // namespace

bool IsProbe(lua_State* L) {
    if (t_Depth == 0) return false;  // on this thread, in any interpreter
    lua_getfield(L, LUA_REGISTRYINDEX, kIgnoreErrors);
    bool isProbe = lua_toboolean(L, -1);
    lua_pop(L, 1);
    return isProbe;
}

int activeobj(lua_State* L) {
    lua_settop(L, 1);
    getactiveobj(L);
    lua_insert(L, 1);
    lua_setfield(L, LUA_REGISTRYINDEX, kActiveObject);
    return 1;
}

int getactiveobj(lua_State* L) {
    lua_getfield(L, LUA_REGISTRYINDEX, kActiveObject);
    return 1;
}

void SetGlobalIndex(lua_State* L) {
    if (!lua_getmetatable(L, LUA_GLOBALSINDEX)) {
        lua_createtable(L, 0, 1);
        lua_pushvalue(L, -1);
        lua_setmetatable(L, LUA_GLOBALSINDEX);
    }
    lua_pushliteral(L, "__index");
    lua_pushcfunction(L, Index);
    lua_pushcclosure(L, global_index, 1);
    lua_rawset(L, -3);
    lua_pop(L, 1);
}

}  // namespace Korvel

#include <dlfcn.h>

#include "runtime/lua/LuaGuardInternal.h"

namespace Korvel {
namespace {

// The file that a function lies in.
const void* FileOf(void* function) {
    Dl_info info;
    return dladdr(function, &info) ? info.dli_fbase : nullptr;
}

}  // namespace

bool IsLuaJIT() {
    static const bool isLuaJIT = FileOf(reinterpret_cast<void*>(lua_newstate)) ==
                                 FileOf(reinterpret_cast<void*>(luaJIT_setmode));
    return isLuaJIT;
}

void Keep(lua_State* L, lua_CFunction function) {
    lua_pushlightuserdata(L, reinterpret_cast<void*>(function));
    lua_pushcfunction(L, function);
    lua_rawset(L, LUA_REGISTRYINDEX);
}

void PushKept(lua_State* L, lua_CFunction function) {
    lua_pushlightuserdata(L, reinterpret_cast<void*>(function));
    lua_rawget(L, LUA_REGISTRYINDEX);
}

void PushWeakTable(lua_State* L, void* key) {
    lua_pushlightuserdata(L, key);
    lua_rawget(L, LUA_REGISTRYINDEX);
    if (lua_istable(L, -1)) return;
    lua_pop(L, 1);
    lua_newtable(L);
    lua_createtable(L, 0, 1);
    lua_pushliteral(L, "kv");
    lua_setfield(L, -2, "__mode");
    lua_setmetatable(L, -2);
    lua_pushlightuserdata(L, key);
    lua_pushvalue(L, -2);
    lua_rawset(L, LUA_REGISTRYINDEX);
}

int RunJob(lua_State* L) {
    LuaJob& job = *static_cast<LuaJob*>(lua_touserdata(L, 1));
    lua_remove(L, 1);
    job.m_Run(L, job.m_Work);
    return lua_gettop(L);
}

ProtectedCalls::ProtectedCalls(lua_State* L, int slots) : m_Lua(L) {
    constexpr int kOwnSlots = 8;
    luaL_checkstack(L, slots + kOwnSlots, "no room for a call");
    PushKept(L, RunJob);
    if (lua_isnil(L, -1)) {  // the first time in this interpreter
        lua_pop(L, 1);
        Keep(L, RunJob);
        PushKept(L, RunJob);
    }
    lua_pushlightuserdata(L, &m_Job);
    m_Function = lua_gettop(L) - 1;
}

void ProtectedCalls::Leave() {
    lua_remove(m_Lua, m_Function);
    lua_remove(m_Lua, m_Function);
}

int ProtectedCalls::Run(int first, int count, int numResults) {
    lua_pushvalue(m_Lua, m_Function);
    lua_pushvalue(m_Lua, m_Function + 1);
    for (int i = 0; i < count; i++) lua_pushvalue(m_Lua, first + i);
    return lua_pcall(m_Lua, 1 + count, numResults, 0);
}

}  // namespace Korvel

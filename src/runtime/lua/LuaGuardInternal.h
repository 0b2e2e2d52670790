#pragma once

#include <cstdio>
#include <exception>
#include <lua.hpp>

namespace Korvel {

// Whether the Lua that this process runs is LuaJIT: inside of a plain interpreter the functions of
// its Lua come first, and LuaJIT's own do not know its states.
bool IsLuaJIT();

// The interpreter, or the coroutine of one, that has called out to native code on this thread; null
// while none has. Work that comes back to a state from there goes on where its script stands. Under
// plain Lua an error jumps past the line that takes it back, so there it is not to be believed. The
// fixed model spares every call out of Lua a call to find the variable.
[[gnu::tls_model("initial-exec")]] inline constinit thread_local lua_State* t_CallingLua = nullptr;

// Calls native code of others from a C function of Lua: a callback of the host's, a handler of a
// type. A std::exception that comes back becomes a Lua error with its text. Lua errors pass; where
// they are long jumps, what `call` holds is lost, so it holds nothing.
template <class Call>
inline int CallOut(lua_State* L, Call&& call) {
    char text[400];
    lua_State* outer = t_CallingLua;
    try {
        struct Restore {
            lua_State* m_Outer;
            ~Restore() { t_CallingLua = m_Outer; }
        } restore{outer};
        t_CallingLua = L;
        return call();
    } catch (const std::exception& error) {
        snprintf(text, sizeof(text), "%s", error.what());
    }
    return luaL_error(L, "%s", text);
}

}  // namespace Korvel

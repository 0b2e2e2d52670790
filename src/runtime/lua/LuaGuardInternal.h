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

// C functions that lie in the registry under their own addresses: pushing one from there makes
// nothing, and so cannot fail. Keep puts it there.
void Keep(lua_State* L, lua_CFunction function);
void PushKept(lua_State* L, lua_CFunction function);

// Pushes the weak table that stands in the registry under a key of its user's, made at first use.
void PushWeakTable(lua_State* L, void* key);

// Native work as a call of a C function: RunJob's first argument is the job, the others are all
// that the work finds on the stack, and what it leaves there are the results. The work holds
// nothing with a destructor while it calls Lua.
struct LuaJob {
    LuaJob() = default;
    template <class Work>
    explicit LuaJob(Work& work)
        : m_Run([](lua_State* L, void* body) { (*static_cast<Work*>(body))(L); }), m_Work(&work) {}

    void (*m_Run)(lua_State* L, void* work) = nullptr;
    void* m_Work = nullptr;
};
int RunJob(lua_State* L);

// Calls that may raise Lua errors, made by code that owns something: native frames with destructors
// would be jumped over, or left with nothing to show which error it was. The object itself owns
// nothing; it is made first, where an error may still pass.
class ProtectedCalls {
public:
    // Leaves two values on the stack, which stay below those of the calls, and room for `slots`
    // more. Raises where there is none.
    explicit ProtectedCalls(lua_State* L, int slots = 0);
    ProtectedCalls(const ProtectedCalls&) = delete;
    ProtectedCalls& operator=(const ProtectedCalls&) = delete;

    // Runs work(L) in a frame of its own with copies of the `count` values from index `first` on.
    // Of its results `numResults` stay, or all with LUA_MULTRET. Returns lua_pcall's status, with
    // the error on top of the stack unless that is 0.
    template <class Work>
    int Call(int first, int count, int numResults, Work&& work) {
        m_Job = LuaJob(work);
        return Run(first, count, numResults);
    }

    // Takes its own two values from the stack, from below what the calls have left.
    void Leave();

private:
    int Run(int first, int count, int numResults);

    lua_State* const m_Lua;
    int m_Function;  // index of RunJob, and behind it of the job
    LuaJob m_Job;
};

}  // namespace Korvel

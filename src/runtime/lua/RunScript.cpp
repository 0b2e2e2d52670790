#include "runtime/lua/RunScript.h"

#include <algorithm>
#include <climits>
#include <cstdio>
#include <lua.hpp>

#include "Platform/NoKillInternal.h"
#include "runtime/lua/KRScriptLib.h"

namespace Korvel {
namespace {

enum : int { kFailed = -1, kNotLoaded = -2 };

struct ScriptRun {
    const char* m_File;
    char** m_Argv;
    int m_Result;
};

void WriteLine(const char* text) {
    Platform::NoKill noKill;
    fprintf(stderr, "%s\n", text);
}

const char* MessageAt(lua_State* L, int index) {
    const char* text = lua_tostring(L, index);
    return text ? text : "unknown error";
}

int l_alert(lua_State* L) {
    WriteLine(MessageAt(L, 1));
    return 0;
}

int ToResult(lua_State* L, int index) {
    if (lua_type(L, index) != LUA_TNUMBER) return 0;
    double number = lua_tonumber(L, index);
    if (number != number) return 0;
    return static_cast<int>(std::clamp<double>(number, INT_MIN, INT_MAX));
}

int LoadAndCall(lua_State* L) {
    ScriptRun& run = *static_cast<ScriptRun*>(lua_touserdata(L, 1));
    OpenAllLibs(L);
    SetArgs(L, run.m_Argv, 1);
    lua_pushcfunction(L, l_alert);
    if (luaL_loadfile(L, run.m_File) != 0) {
        run.m_Result = kNotLoaded;
        lua_call(L, 1, 0);
        return 0;
    }
    int status = lua_pcall(L, 0, LUA_MULTRET, 1);
    // For a lack of memory, and an error inside of the handler, the handler is not called.
    if (status != 0 && status != LUA_ERRRUN) WriteLine(MessageAt(L, -1));
    run.m_Result = status == 0 ? ToResult(L, 2) : kFailed;
    return 0;
}

}  // namespace
}  // namespace Korvel

extern "C" int RunScript(const char* file, char** argv) {
    using namespace Korvel;
    if (!file) {  // for the interpreter it would mean standard input
        WriteLine("no script file given");
        return kNotLoaded;
    }
    lua_State* L = luaL_newstate();
    if (!L) {
        WriteLine("not enough memory for an interpreter");
        return kFailed;
    }
    ScriptRun run{file, argv, kFailed};
    if (lua_cpcall(L, LoadAndCall, &run) != 0) WriteLine(MessageAt(L, -1));
    CloseInterpreter(L);
    return run.m_Result;
}

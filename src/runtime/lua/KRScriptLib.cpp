// What scripts find in `orv`. This source is reached by `require "krscript"` from plain Lua 5.1,
// where an error is a longjmp: no function here holds an object with a destructor across a call
// that can raise one.
#include "runtime/lua/KRScriptLib.h"

#include <unistd.h>

#include <cstring>

#include "Platform/Lock.h"
#include "Platform/Time.h"
#include "runtime/lua/KRScriptLibInternal.h"
#include "runtime/lua/LuaObject.h"
#include "runtime/lua/LuaType.h"
#include "runtime/lua/LuaValues.h"

extern "C" int luaopen_lpeg(lua_State* L);

namespace Korvel {
namespace {

constexpr char kVersion[] = "18.0";

KorvelScript::Lock s_CloseLock;  // held while an interpreter is closed

// The longest wait that a number of milliseconds can ask for.
constexpr double kMaxWaitMs = 4294967295.0;

// The host library's functions are named as scripts call them.

int getpid(lua_State* L) {
    lua_pushnumber(L, ::getpid());
    return 1;
}

// Sleeps. The duration is in seconds; what is no number above 0 does not sleep.
int wait(lua_State* L) {
    double ms = lua_tonumber(L, 1) * 1000;
    if (ms > 0) Platform::Wait(static_cast<unsigned long long>(ms < kMaxWaitMs ? ms : kMaxWaitMs));
    return 0;
}

int getuptime(lua_State* L) {
    lua_pushnumber(L, static_cast<double>(Platform::GetUpTime()) / 1000);
    return 1;
}

int gettime(lua_State* L) {
    lua_pushnumber(L, static_cast<double>(Platform::GetTimeCount()) /
                          static_cast<double>(Platform::GetTimeFreq()));
    return 1;
}

// os.exit: leaves the code and the data in two globals and ends the script with an empty error. The
// process is the host's to end.
int myexit(lua_State* L) {
    lua_settop(L, 2);
    if (lua_type(L, 2) != LUA_TTABLE) {
        lua_pushnil(L);
        lua_replace(L, 2);
    }
    SetGlobalRaw(L, "_EXITDATA");
    lua_pushnumber(L, lua_type(L, 1) == LUA_TNUMBER ? lua_tonumber(L, 1) : 0);
    SetGlobalRaw(L, "_EXITCODE");
    lua_settop(L, 0);
    lua_pushliteral(L, "");
    return lua_error(L);
}

constexpr luaL_Reg kFunctions[] = {
    {"getpid", getpid}, {"wait", wait},       {"getuptime", getuptime},   {"gettime", gettime},
    {"exit", myexit},   {"using", activeobj}, {"getusing", getactiveobj}, {nullptr, nullptr},
};

// Opens the library under its second name: a table of its own with all that the first one holds.
void OpenTwin(lua_State* L, const char* name, int original) {
    constexpr luaL_Reg kNothing[] = {{nullptr, nullptr}};
    luaL_register(L, name, kNothing);
    lua_pushnil(L);
    while (lua_next(L, original)) {
        lua_pushvalue(L, -2);
        lua_insert(L, -2);
        lua_rawset(L, -4);
    }
    lua_pop(L, 1);
}

// Puts a searcher behind the first one, which looks at what has been preloaded, and before those
// that look for files.
void InsertLoader(lua_State* L, lua_CFunction loader) {
    lua_getfield(L, -1, "loaders");
    for (int i = static_cast<int>(lua_objlen(L, -1)); i >= 2; i--) {
        lua_rawgeti(L, -1, i);
        lua_rawseti(L, -2, i + 1);
    }
    lua_pushcfunction(L, loader);
    lua_rawseti(L, -2, 2);
    lua_pop(L, 1);
}

// Returns the table `orv`.
int OpenHostLib(lua_State* L) {
    register_memblock(L);
    luaL_register(L, "orv", kFunctions);
    luaL_register(L, nullptr, kRemoteFunctions);
    int orv = lua_gettop(L);
    lua_pushliteral(L, "_VERSION");
    lua_pushstring(L, kVersion);
    lua_rawset(L, orv);
    OpenTwin(L, "ondry", orv);
    lua_getglobal(L, "os");
    if (lua_istable(L, -1)) {
        lua_getfield(L, orv, "exit");
        lua_setfield(L, -2, "exit");
    }
    lua_settop(L, orv);
    s_LuaType_RemoteObject.lw_register(L);
    RunStartupScripts(L);
    SetGlobalIndex(L);
    return 1;
}

}  // namespace

void OpenAllLibs(lua_State* L, TagList*) {
    lua_gc(L, LUA_GCSTOP, 0);  // what is made here stays
    luaL_openlibs(L);
    lua_getglobal(L, "package");
    int package = lua_gettop(L);
    InsertLoader(L, myloader);
    lua_getfield(L, package, "preload");
    lua_pushcfunction(L, luaopen_lpeg);
    lua_setfield(L, -2, "lpeg");
    require(L, "lpeg", true);
    lua_getfield(L, package, "loaded");
    OpenHostLib(L);
    lua_setfield(L, -2, "krscript");
    lua_settop(L, 0);
    lua_gc(L, LUA_GCRESTART, -1);  // with the pause that follows a collection
}

void CloseAllLibs(lua_State*, TagList*) {}

void CloseInterpreter(lua_State* L) {
    CloseAllLibs(L);
    KorvelScript::AutoLock guard(s_CloseLock);
    lua_close(L);
}

void SetArgs(lua_State* L, char** argv, int first) {
    lua_newtable(L);
    int next = first;
    for (; argv && *argv; argv++) {
        if (const char* sign = strchr(*argv, '=')) {
            lua_pushlstring(L, *argv, static_cast<size_t>(sign - *argv));
            lua_pushstring(L, sign + 1);
            lua_rawset(L, -3);
        } else {
            lua_pushstring(L, *argv);
            lua_rawseti(L, -2, next++);
        }
    }
    lua_pushnumber(L, next - 1);
    lua_setfield(L, -2, "n");
    lua_setglobal(L, "arg");
}

}  // namespace Korvel

extern "C" int luaopen_krscript(lua_State* L) {
    Korvel::EnsureConfig();
    return Korvel::OpenHostLib(L);
}

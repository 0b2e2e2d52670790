// What scripts find in `orv` to reach other processes. None of it raises an error for an argument
// of the wrong type, which counts as one that is not given.
#include <cstdlib>

#include "core/ScriptValInternal.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"
#include "runtime/lua/KRScriptLibInternal.h"
#include "runtime/lua/LuaGuardInternal.h"
#include "runtime/lua/LuaValues.h"

namespace Korvel {
namespace {

constexpr char kThisMachine[] = "127.0.0.1";
constexpr double kPingSeconds = 1;
constexpr unsigned int kEverybody = 0xFFFFFFFF;

const char* TextAt(lua_State* L, int index, const char* def) {
    return lua_type(L, index) == LUA_TSTRING ? PlainText(L, index) : def;
}

double NumberAt(lua_State* L, int index, double def) {
    return lua_type(L, index) == LUA_TNUMBER ? lua_tonumber(L, index) : def;
}

// Pushes the value that `get` gives; it may take its time, and hold what it likes.
template <class Get>
int PushResult(lua_State* L, Get&& get) {
    ProtectedCalls calls(L);
    int status;
    {
        ScriptVal value = get();
        status = calls.Call(0, 0, 1, [&](lua_State* inner) {
            ToLua(value.GetApp(), inner, value, nullptr, nullptr, 0);
        });
    }
    return status == 0 ? 1 : lua_error(L);
}

struct AppArguments {
    explicit AppArguments(lua_State* L) {
        lua_settop(L, 5);
        m_Name = TextAt(L, 1, nullptr);
        m_Address = TextAt(L, 2, kThisMachine);
        m_TimeOut = NumberAt(L, 3, 0);
        m_UUID = TextAt(L, 4, nullptr);
        m_Subtype = TextAt(L, 5, nullptr);
    }

    const char* m_Name;
    const char* m_Address;
    double m_TimeOut;
    const char* m_UUID;
    const char* m_Subtype;
};

int scriptapp(lua_State* L) {
    AppArguments app(L);
    return PushResult(L, [&] {
        return ScriptApp(app.m_Name, app.m_Subtype, app.m_UUID, app.m_Address, app.m_TimeOut);
    });
}

int asyncscriptapp(lua_State* L) {
    AppArguments app(L);
    return PushResult(L, [&] {
        return AsyncScriptApp(app.m_Name, app.m_Subtype, app.m_UUID, app.m_Address, app.m_TimeOut,
                              true);
    });
}

// pinghosts(name, timeOut, host). Without a host, or with "*", everybody is asked. No result where
// that fails.
int pinghosts(lua_State* L) {
    lua_settop(L, 3);
    const char* name = TextAt(L, 1, "");
    double timeOut = NumberAt(L, 2, kPingSeconds);
    std::string_view host = TextAt(L, 3, "");
    unsigned int ip = kEverybody;
    if (!host.empty() && host != "*") ip = RemoteApp::IPFromStr(host.data());
    if (!ip) return 0;
    bool isDone = false;
    int count = PushResult(L, [&] {
        ScriptVal answers;
        isDone = Ping(name, timeOut, answers, ip);
        return answers;
    });
    return isDone ? count : 0;
}

int startserver(lua_State*) {
    StartServer();
    return 0;
}

int getappname(lua_State* L) {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    if (!config || !config->m_AppName) return 0;
    lua_pushstring(L, config->m_AppName);
    return 1;
}

int getappuuid(lua_State* L) {
    const char* uuid = GetAppUUID().ToString();
    if (!uuid) return 0;
    lua_pushstring(L, uuid);
    return 1;
}

int createuuid(lua_State* L) {
    return PushResult(L, [] { return ScriptVal::CreateUUID(); });
}

// sendnotify(target, name, object, ...) calls a member of a proxy, or of each proxy that a table
// has, and does not wait for an answer.
int sendnotify(lua_State* L) {
    int count = lua_gettop(L) - 1;
    if (count < 1) return 0;
    ProtectedCalls calls(L, count);
    int status;
    {
        ScriptVal target;
        ScriptArgs args;
        status = calls.Call(1, count + 1, 0, [&](lua_State* inner) {
            FromLua(inner, 1, target, nullptr, nullptr, 0);
            for (int i = 0; i < count; i++) {
                TableEntry* entry = NewEntry(static_cast<double>(i));
                if (!entry) luaL_error(inner, "not enough memory");
                entry->m_Key.m_Flags |= SVF_Int;
                Chain::Append(args, entry);
                FromLua(inner, i + 2, entry->m_Value, nullptr, nullptr, 0);
            }
        });
        if (status == 0) SendNotify(target, args);
    }
    return status == 0 ? 0 : lua_error(L);
}

// What waits may come back to the state of the script that calls.
template <lua_CFunction Function>
int Out(lua_State* L) {
    return CallOut(L, [L] { return Function(L); });
}

// A plain interpreter's process.
bool StartClient() {
    static constinit ScriptConfig s_Config;
    s_Config.m_AppName = "korvelscript";
    InitScripting(s_Config);
    if (g_ScriptConfig != &s_Config) return false;
    atexit([] { CleanupScripting(); });  // what a script has sent at its end leaves, too
    return StartScripting(ScriptVal());
}

}  // namespace

const luaL_Reg kRemoteFunctions[] = {
    {"pinghosts", Out<pinghosts>},
    {"startserver", Out<startserver>},
    {"getappname", getappname},
    {"getappuuid", getappuuid},
    {"createuuid", createuuid},
    {"scriptapp", Out<scriptapp>},
    {"asyncscriptapp", Out<asyncscriptapp>},
    {"sendnotify", Out<sendnotify>},
    {nullptr, nullptr},
};

void EnsureConfig() {
    if (g_ScriptConfig) return;
    [[maybe_unused]] static const bool isStarted = StartClient();
}

}  // namespace Korvel

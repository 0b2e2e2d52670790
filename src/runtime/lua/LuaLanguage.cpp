// The Lua back end. Every way into the interpreter from native code is protected: an error ends the
// entry, never the thread. Entries may nest, where a print function asks its own state for
// something; the inner one runs where the script stands, and leaves the stack there as it was.
#include "runtime/lua/LuaLanguage.h"

#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <lua.hpp>
#include <string>

#include "Platform/NoKillInternal.h"
#include "core/TextCellInternal.h"
#include "runtime/RuntimeHooksInternal.h"
#include "runtime/lua/KRScriptLib.h"
#include "runtime/lua/KRScriptLibInternal.h"
#include "runtime/lua/LuaGuardInternal.h"
#include "runtime/lua/LuaType.h"
#include "runtime/lua/LuaValues.h"

namespace Korvel {

extern const char kCaptureScript[];  // scripts/capture.lua

namespace {

using KorvelScript::ScriptState;

constexpr char kStateKey[] = "KorvelScriptState";
constexpr char kCaptureKey[] = "KorvelCaptureVars";
constexpr char kPlatformMarker[] = "OxPLATFORM_LINUX";
constexpr int kHookCount = 1000;  // instructions from one count event to the next
constexpr int kSlots = 20;        // what an entry may push before it asks for more

constinit EmbeddedScript s_Capture(kCaptureScript);

int myprint(lua_State* L) {
    ScriptState* state = GetState(L);
    if (!state) return 0;
    int count = lua_gettop(L);
    lua_getglobal(L, "tostring");
    for (int i = 1; i <= count; i++) {
        lua_pushvalue(L, count + 1);
        lua_pushvalue(L, i);
        lua_call(L, 1, 1);
        if (lua_type(L, -1) != LUA_TSTRING) {
            return luaL_error(L, "'tostring' must return a string to 'print'");
        }
        const char* text = PlainText(L, count + 2);
        CallOut(L, [&] {
            if (i > 1) state->DoPrint("\t");
            state->DoPrint(text);
            return 0;
        });
        lua_settop(L, count + 1);
    }
    return CallOut(L, [&] {
        state->DoPrint("\n");
        return 0;
    });
}

int myalert(lua_State* L) {
    ScriptState* state = GetState(L);
    if (!state) return 0;
    lua_settop(L, 1);
    const char* text = PlainText(L, 1);
    return CallOut(L, [&] {
        state->DoError(text ? text : "unknown error");
        state->DoError("\n");
        return 0;
    });
}

int mysetdebugtransport(lua_State* L) {
    ScriptState* state = GetState(L);
    if (!state) return 0;
    if (lua_toboolean(L, 1)) {
        state->SetFlags(KorvelScript::STF_Trace);
    } else {
        state->ClearFlags(KorvelScript::STF_Trace);
    }
    return 0;
}

int initffi(lua_State* L) {
    RunOrderedTableScript(L);
    g_RuntimeHooks.m_InitFFI(L, -1);
    return 0;
}

void my_hook(lua_State* L, lua_Debug* record) {
    ScriptState* state = GetState(L);
    if (!state) return;
    CallOut(L, [&] {
        if (state->IsDebug()) {
            state->DebugHook(reinterpret_cast<KorvelScript::DebugHookData*>(record));
        }
        return 0;
    });
}

// The message handler of runs: keeps where the error happened for the state's GetTraceback.
int KeepTraceback(lua_State* L) {
    ScriptState* state = GetState(L);
    if (state && IsLuaJIT()) {
        // This function is level 0.
        luaL_traceback(L, L, nullptr, 1);
        state->SetTraceback(lua_tostring(L, -1));
        lua_pop(L, 1);
    }
    return 1;
}

// An error value as a text.
int Describe(lua_State* L) {
    lua_settop(L, 1);
    if (!lua_isstring(L, 1) && luaL_callmeta(L, 1, "__tostring")) lua_replace(L, 1);
    if (!PlainText(L, 1)) {
        lua_pushfstring(L, "(error object is a %s value)", luaL_typename(L, 1));
    }
    return 1;
}

// Tells an error to the host. The text stands in this frame, so that a host that turns to its own
// state meanwhile does not lose it.
int ReportError(lua_State* L) {
    ScriptState* state = GetState(L);
    lua_settop(L, 1);
    lua_pushcfunction(L, Describe);
    lua_insert(L, 1);
    bool isDescribed = lua_pcall(L, 1, 1, 0) == 0 && lua_type(L, 1) == LUA_TSTRING;
    const char* text = isDescribed ? lua_tostring(L, 1) : "unknown error";
    return CallOut(L, [&] {
        state->DoError(text);
        state->DoError("\n");
        return 0;
    });
}

// Hands an error to the script's own handler.
int CallAlert(lua_State* L) {
    lua_getglobal(L, "_ALERT");
    lua_insert(L, 1);
    lua_call(L, 1, 0);
    return 0;
}

bool IsInScript(lua_State* L) {
    lua_Debug frame;
    return lua_getstack(L, 0, &frame) != 0;
}

// Puts the stack back as it was. Outside of a script an entry may leave its results there.
class Entry {
public:
    explicit Entry(lua_State* L, bool leavesResults = false)
        : m_Lua(L), m_Top(leavesResults && !IsInScript(L) ? -1 : lua_gettop(L)) {}
    Entry(const Entry&) = delete;
    Entry& operator=(const Entry&) = delete;
    ~Entry() {
        if (m_Top >= 0) lua_settop(m_Lua, m_Top);
    }

private:
    lua_State* m_Lua;
    int m_Top;
};

// Room for an entry. What earlier ones have left on the stack goes when there is no other room.
bool Reserve(lua_State* L, int slots) {
    if (lua_checkstack(L, slots)) return true;
    if (IsInScript(L)) return false;
    lua_settop(L, 0);
    return lua_checkstack(L, slots);
}

// Tells the error on top of the stack, which it pops, to the host.
void Report(lua_State* L) {
    PushKept(L, ReportError);
    lua_insert(L, -2);
    if (lua_pcall(L, 1, 0, 0) != 0) lua_pop(L, 1);  // the host has failed itself
}

// Hands the error on top of the stack, which it pops, to the script's own handler, and where that
// fails to the host.
void Alert(lua_State* L) {
    PushKept(L, CallAlert);
    lua_pushvalue(L, -2);
    if (lua_pcall(L, 1, 0, 0) != 0) {
        lua_pop(L, 1);
        Report(L);
    } else {
        lua_pop(L, 1);
    }
}

// Runs work(L) protected, in a frame of its own. What it pushes stays on the stack. False when it
// has failed, which is then reported. The work holds nothing with a destructor while it calls Lua.
template <class Work>
bool Protect(lua_State* L, ScriptState* state, Work&& work) {
    LuaJob job(work);
    if (!Reserve(L, kSlots)) {
        state->DoError("The script's stack is full.");
        state->DoError("\n");
        return false;
    }
    PushKept(L, RunJob);
    lua_pushlightuserdata(L, &job);
    if (lua_pcall(L, 1, LUA_MULTRET, 0) == 0) return true;
    Alert(L);
    return false;
}

// Pushes what a dotted name stands for; nil where it leads nowhere.
void lua_getglobalnest(lua_State* L, const char* name) {
    lua_pushvalue(L, LUA_GLOBALSINDEX);
    while (name) {
        if (!lua_istable(L, -1)) {
            if (!luaL_getmetafield(L, -1, "__index")) break;
            lua_pop(L, 1);
        }
        const char* dot = strchr(name, '.');
        lua_pushlstring(L, name, dot ? static_cast<size_t>(dot - name) : strlen(name));
        lua_gettable(L, -2);
        lua_remove(L, -2);
        if (!dot) return;
        name = dot + 1;
    }
    lua_pop(L, 1);
    lua_pushnil(L);
}

unsigned int ToValueType(int luaType) {
    switch (luaType) {
        case LUA_TBOOLEAN:
            return SV_Boolean;
        case LUA_TNUMBER:
            return SV_Number;
        case LUA_TSTRING:
            return SV_String;
        case LUA_TTABLE:
            return SV_Table;
        case LUA_TFUNCTION:
            return SV_Function;
        default:
            return SV_Nil;
    }
}

bool IsDigit(char c) {
    return c >= '0' && c <= '9';
}
bool IsLetter(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '_';
}

bool IsName(std::string_view word) {
    constexpr std::string_view kReserved[] = {
        "and",      "break",  "do",   "else", "elseif", "end",  "false", "for",
        "function", "goto",   "if",   "in",   "local",  "nil",  "not",   "or",
        "repeat",   "return", "then", "true", "until",  "while"};
    if (word.empty() || IsDigit(word[0])) return false;
    for (char c : word) {
        if (!IsLetter(c) && !IsDigit(c)) return false;
    }
    for (std::string_view reserved : kReserved) {
        if (word == reserved) return false;
    }
    return true;
}

// Whether a name can stand in a program's text: names joined by dots.
bool IsNamePath(const char* path) {
    std::string_view rest(path ? path : "");
    for (size_t dot; (dot = rest.find('.')) != rest.npos; rest.remove_prefix(dot + 1)) {
        if (!IsName(rest.substr(0, dot))) return false;
    }
    return IsName(rest);
}

bool EndsInEof(const char* message) {
    constexpr char kEof[] = "'<eof>'";
    constexpr size_t kLength = sizeof(kEof) - 1;
    size_t length = strlen(message);
    return length >= kLength && strcmp(message + length - kLength, kEof) == 0;
}

}  // namespace

KorvelScript::ScriptState* GetState(lua_State* L) {
    lua_getfield(L, LUA_REGISTRYINDEX, kStateKey);
    void** holder = static_cast<void**>(lua_touserdata(L, -1));
    lua_pop(L, 1);
    return holder ? static_cast<ScriptState*>(*holder) : nullptr;
}

namespace KorvelScript {

ScriptState* LuaScriptLanguage::_NewState(ScriptObject* object, unsigned int flags) {
    LuaScriptState* state = new LuaScriptState(this, object, flags);
    if (!state || state->_GetRawState()) return state;
    state->Recycle();
    return nullptr;
}

LuaScriptState::LuaScriptState(ScriptLanguage* language, ScriptObject* object, unsigned int flags)
    : ScriptState(language, object, flags), m_Lua(luaL_newstate()) {
    if (!m_Lua) return;
    auto open = [](lua_State* L) -> int {
        ScriptState* state = static_cast<ScriptState*>(lua_touserdata(L, 1));
        for (lua_CFunction function : {RunJob, KeepTraceback, ReportError, CallAlert})
            Keep(L, function);
        OpenAllLibs(L);
        lua_pushboolean(L, true);
        lua_setglobal(L, kPlatformMarker);
        const luaL_Reg functions[] = {{"print", myprint},
                                      {"_ALERT", myalert},
                                      {"_setdebugtransport", mysetdebugtransport},
                                      {"_initffi", initffi}};
        for (const luaL_Reg& function : functions) {
            lua_pushcfunction(L, function.func);
            lua_setglobal(L, function.name);
        }
        lua_pushobject(L, state, nullptr);
        lua_setfield(L, LUA_REGISTRYINDEX, kStateKey);
        if (s_Capture.Load(L) == 0 && lua_pcall(L, 0, 1, 0) == 0) {
            lua_setfield(L, LUA_REGISTRYINDEX, kCaptureKey);
        } else {
            Platform::NoKill noKill;
            const char* text = lua_tostring(L, -1);
            printf("err1: %s\n", text ? text : "");
        }
        lua_sethook(L, my_hook, 0, 0);
        return 0;
    };
    if (lua_cpcall(m_Lua, open, static_cast<ScriptState*>(this)) != 0) {
        CloseInterpreter(m_Lua);
        m_Lua = nullptr;
    }
}

LuaScriptState::~LuaScriptState() {
    if (m_Lua) CloseInterpreter(m_Lua);
}

// Where an entry goes on: in the script that has called out, which may be a coroutine.
lua_State* LuaScriptState::Here() const {
    lua_State* calling = IsLuaJIT() ? t_CallingLua : nullptr;
    return calling && GetState(calling) == this ? calling : m_Lua;
}

unsigned int LuaScriptState::_Execute(const char* text, unsigned int flags, const char* name) {
    // The line end closes a comment at the end of the text.
    std::string wrapped;
    if (flags & SEXEC_Dump) {
        wrapped = std::string("dump(") + text + "\n)";
    } else if (flags & SEXEC_Print) {
        wrapped = std::string("print(") + text + "\n)";
    }
    const char* source = wrapped.empty() ? text : wrapped.c_str();
    lua_State* L = Here();
    Entry entry(L, true);
    if (!Reserve(L, kSlots)) return ReportNoRoom();
    int top = lua_gettop(L);
    PushKept(L, KeepTraceback);
    int status = luaL_loadbuffer(L, source, strlen(source), name ? name : "???");
    bool isLoaded = status == 0;
    if (isLoaded) status = lua_pcall(L, 0, LUA_MULTRET, top + 1);
    if (status == 0) {
        SetOutcome(L, top + 2);
        lua_remove(L, top + 1);
        return SRES_Done;
    }
    const char* message = isLoaded ? nullptr : lua_tostring(L, -1);
    if ((flags & SEXEC_Interactive) && message && EndsInEof(message)) {
        lua_settop(L, top);
        return SRES_Incomplete;
    }
    OxStringT<char> traceback(GetTraceback());  // the host may run something else meanwhile
    Report(L);
    lua_settop(L, top);
    SetRunResult(ScriptVal());
    SetTraceback(traceback);
    return SRES_Failed;
}

// What a run that has succeeded leaves; runs inside of it have left something of theirs.
void LuaScriptState::SetOutcome(lua_State* L, int firstResult) {
    bool isNumber = lua_type(L, firstResult) == LUA_TNUMBER;
    SetRunResult(isNumber ? ScriptVal(lua_tonumber(L, firstResult)) : ScriptVal());
    SetTraceback(nullptr);
}

unsigned int LuaScriptState::_ExecuteFile(const char* file, unsigned int, const char*) {
    lua_State* L = Here();
    Entry entry(L);
    OxStringT<char> traceback;
    bool hasRun = false;
    bool isDone = Protect(L, this, [&](lua_State* inner) {
        PushKept(inner, KeepTraceback);
        lua_getglobal(inner, "callglob");
        hasRun = luaL_loadfile(inner, file) == 0;
        if (!hasRun || lua_pcall(inner, 1, 1, 1) != 0) {
            if (hasRun) traceback = GetTraceback();
            lua_error(inner);
        }
        SetOutcome(inner, -1);
    });
    if (isDone) return SRES_Done;
    SetRunResult(ScriptVal());
    SetTraceback(traceback);
    return SRES_Failed;
}

unsigned int LuaScriptState::_Call(const char* name, const char* first, ...) {
    std::string text = std::string(name ? name : "") + "(";
    va_list args;
    va_start(args, first);
    for (const char* arg = first; arg; arg = va_arg(args, const char*)) {
        if (arg != first) text += ", ";
        text += arg;
    }
    va_end(args);
    Execute((text + ")").c_str());
    return 0;
}

void LuaScriptState::_SetGlobal(const char* name, const ScriptVal& value, unsigned int) {
    if (!name) return;
    lua_State* L = Here();
    Entry entry(L);
    Protect(L, this, [&](lua_State* inner) {
        // Nothing is written to the value; the callbacks that take it as one that may be changed
        // are the host's own.
        auto& source = const_cast<ScriptVal&>(value);
        if (!ToLua(GetThisApp(), inner, source, nullptr, nullptr, TOLUA_AskPeer)) return;
        lua_settop(inner, 1);  // code has any number of results
        lua_setglobal(inner, name);
    });
}

void LuaScriptState::_SetGlobalObject(const char* name, const ScriptObject* object,
                                      unsigned long long reference, unsigned int) {
    if (!IsNamePath(name)) return RefuseName(name);
    auto low = [](unsigned long long word) { return static_cast<unsigned int>(word); };
    auto address = reinterpret_cast<unsigned long long>(object);
    OxID text;
    text.PrintF("%s = class._ScriptObject(_thisapp, %u, %u, %u, %u)", name, low(address),
                low(address >> 32), low(reference), low(reference >> 32));
    lua_State* L = Here();
    Entry entry(L, true);
    if (Reserve(L, kSlots) && luaL_loadstring(L, text) == 0) lua_pcall(L, 0, 0, 0);
}

unsigned int LuaScriptState::_GetGlobal(const char* name, ScriptVal& value, unsigned int) {
    lua_State* L = Here();
    Entry entry(L, true);
    bool isDone = Protect(L, this, [&](lua_State* inner) {
        lua_getglobalnest(inner, name);
        if (!FromLua(inner, -1, value, nullptr, nullptr, 0)) luaL_error(inner, "not enough memory");
    });
    if (isDone) return SRES_Done;
    value = SV_Nil;
    return SRES_Failed;
}

unsigned int LuaScriptState::_GetGlobalType(const char* name, unsigned int) {
    lua_State* L = Here();
    Entry entry(L);
    unsigned int type = SV_Nil;
    Protect(L, this, [&](lua_State* inner) {
        lua_getglobalnest(inner, name);
        type = ToValueType(lua_type(inner, -1));
    });
    return type;
}

void LuaScriptState::_SetThisApp(const char* name, const char* shortName) {
    if (!IsNamePath(name)) return RefuseName(name);
    if (shortName && !IsNamePath(shortName)) return RefuseName(shortName);
    OxID text;
    text.PrintF(
        "repeat _thisapp = ThisApp(); if not _thisapp then wait(0.1) end; "
        "until _thisapp ~= nil; %s = _thisapp; app = _thisapp",
        name);
    _Execute(text, 0, nullptr);
    if (!shortName) return;
    text.PrintF("%s = _thisapp", shortName);
    _Execute(text, 0, nullptr);
}

void LuaScriptState::_SetArgs(char** argv, int) {
    lua_State* L = Here();
    Entry entry(L);
    Protect(L, this, [&](lua_State* inner) { Korvel::SetArgs(inner, argv, 0); });
}

void LuaScriptState::_CollectGarbage() {
    lua_State* L = Here();
    if (!IsInScript(L)) lua_settop(L, 0);
    Entry entry(L);
    // Finalisers run, and may fail.
    Protect(L, this, [](lua_State* inner) { lua_gc(inner, LUA_GCCOLLECT, 0); });
}

void LuaScriptState::_SetPathMap(const ScriptVal& map) {
    if (!map.IsTable()) return;
    struct Path {
        const char* m_Field;
        const char* m_Setting;
        const char* m_Pattern;
    };
    constexpr Path kPaths[] = {{"path", "LUA_PATH", "LuaModules:?.lua;LuaModules:?/init.lua"},
                               {"cpath", "LUA_CPATH", "LuaModules:?.so"}};
    lua_State* L = Here();
    Entry entry(L);
    for (const Path& path : kPaths) {
        OxStringT<char> mapped;
        if (!g_RuntimeHooks.m_MapPaths(path.m_Pattern, map, mapped)) continue;
        Protect(L, this,
                [&](lua_State* inner) { SetLuaPath(inner, path.m_Field, path.m_Setting, mapped); });
    }
}

// Loops that are compiled never call a hook, so the compiled code is flushed as well. One call that
// flushes and switches does only the first.
void LuaScriptState::_EnableDebug(bool enable) {
    bool wasEnabled = IsDebug();
    ScriptState::_EnableDebug(enable);
    lua_State* L = Here();
    Entry entry(L);
    bool isDebug = IsDebug();
    bool isDone = Protect(L, this, [=](lua_State* inner) {
        constexpr int kEvents = LUA_MASKCALL | LUA_MASKRET | LUA_MASKLINE | LUA_MASKCOUNT;
        if (IsLuaJIT()) {
            luaJIT_setmode(inner, 0, LUAJIT_MODE_ENGINE | LUAJIT_MODE_FLUSH);
            int mode = isDebug ? LUAJIT_MODE_OFF : LUAJIT_MODE_ON;
            luaJIT_setmode(inner, 0, LUAJIT_MODE_ENGINE | mode);
        }
        lua_sethook(inner, my_hook, isDebug ? kEvents : 0, isDebug ? kHookCount : 0);
    });
    // The compiler cannot be switched inside of a finaliser.
    if (!isDone) ScriptState::_EnableDebug(wasEnabled);
}

unsigned int LuaScriptState::ReportNoRoom() {
    DoError("The script's stack is full.");
    DoError("\n");
    return SRES_Failed;
}

void LuaScriptState::RefuseName(const char* name) {
    OxID text;
    text.PrintF("'%s' is no name for a global.", name ? name : "");
    DoError(text);
    DoError("\n");
}

}  // namespace KorvelScript
}  // namespace Korvel

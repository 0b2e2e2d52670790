#include "runtime/ScriptLanguage.h"

#include <strings.h>

#include <string>

#include "Platform/NoKillInternal.h"
#include "Platform/Threads.h"
#include "Platform/Time.h"
#include "remote/ScriptPortInternal.h"
#include "runtime/Script.h"
#include "runtime/ScriptDebug.h"
#include "runtime/lua/LuaLanguage.h"
#include "runtime/python/Py2Language.h"
#include "runtime/python/Py3Language.h"

namespace Korvel::KorvelScript {

ScriptLanguage* g_LuaScriptLanguage = nullptr;
ScriptLanguage* g_Py2ScriptLanguage = nullptr;
ScriptLanguage* g_Py3ScriptLanguage = nullptr;
int g_PyVersion = 0;
int g_PyDefault = 3;
bool g_ThreadSafe = true;
bool g_OxScript = true;

namespace {

constexpr unsigned int kPollMs = 1;

bool IsSame(const char* a, const char* b) {
    return strcasecmp(a, b) == 0;
}

// A Python that is asked for by its version.
ScriptLanguage* GetPython(int version, bool all) {
    if (!all && g_PyVersion != 0 && g_PyVersion != version) return nullptr;
    return version == 2 ? g_Py2ScriptLanguage : g_Py3ScriptLanguage;
}

// The Python that is meant where no version is told.
ScriptLanguage* GetAnyPython() {
    switch (g_PyVersion ? g_PyVersion : g_PyDefault) {
        case 2:
            return g_Py2ScriptLanguage;
        case 3:
            return g_Py3ScriptLanguage;
        default:
            return nullptr;
    }
}

bool IsThere(const char* name) {
    ScriptLanguage* language = GetLanguageByName(name, false);
    return language && language->IsAvailable();
}

OxStringT<char>* JoinExtensions() {
    std::string list;
    if (IsThere("Lua")) list += ".lua|";
    bool python2 = IsThere("Python2");
    bool python3 = IsThere("Python3");
    if (python2 || python3) list += ".py|";
    if (python2) list += ".py2|";
    if (python3) list += ".py3|";
    if (!list.empty()) list.pop_back();
    return new OxStringT<char>(list.c_str());
}

}  // namespace

ScriptLanguage::~ScriptLanguage() {
    while (ScriptState* state = TakeIdle()) state->Recycle();
}

void ScriptLanguage::AwaitReturns() {
    while (m_NumReturning) Platform::Wait(kPollMs);
}

ScriptDebug* ScriptLanguage::_NewDebug(ScriptState*) {
    return nullptr;
}

ScriptState* ScriptLanguage::NewState(ScriptObject* object, unsigned int flags) {
    ScriptState* state = _NewState(object, flags);
    if (!state) return nullptr;
    if (!state->IsNoThread() && !state->StartThread()) {
        state->Recycle();
        return nullptr;
    }
    if (flags & STF_Announce) state->Setup(SCSETUP_Started);
    return state;
}

// An idle state, or null; those that somebody has shut down in the pool are let go of.
ScriptState* ScriptLanguage::TakeIdle() {
    while (true) {
        ScriptState* state;
        {
            Platform::NoKill noKill;
            AutoLock guard(m_PoolLock);
            state = m_Pool.Next(nullptr);
            if (!state) return nullptr;
            m_Pool.Remove(state);
            state->m_IsPooled = false;
            if (!state->HasEnded()) {
                state->m_IsDone = false;
                return state;
            }
        }
        state->Recycle();
    }
}

// True when this thread is to make a state and then to clear m_Maker; false when it already does.
bool ScriptLanguage::BeginMaking(ScriptState*& idle) {
    unsigned long long self = Platform::GetCurrentThreadID();
    while (!(idle = TakeIdle())) {
        {
            Platform::NoKill noKill;
            AutoLock guard(m_PoolLock);
            if (m_Maker == self) return false;
            if (!m_Maker) {
                m_Maker = self;
                return true;
            }
        }
        m_HasMade.Wait(kPollMs);
    }
    return false;
}

// A thread that was killed while it made a state never comes to the end of it.
void ScriptLanguage::ForgetThread(unsigned long long threadID) {
    AutoLock guard(m_PoolLock);
    if (m_Maker == threadID) m_Maker = 0;
}

ScriptState* ScriptLanguage::GetState(TagList&) {
    ScriptState* state;
    bool isMaker = BeginMaking(state);
    if (!state) state = NewState(nullptr, STF_Announce);
    if (isMaker) {
        ForgetThread(Platform::GetCurrentThreadID());
        m_HasMade.Signal();
    }
    return state;
}

void ScriptLanguage::PutState(ScriptState* state) {
    Platform::NoKill noKill;  // the state is on the list or not, and says so
    AutoLock guard(m_PoolLock);
    if (state->m_IsPooled.exchange(true)) return;
    m_Pool.Add(state);
}

int ScriptLanguage::ExecuteFileExternal(const char* file, const ScriptVal& value) {
    return StartScriptProcess(GetShortName(), file, value) ? 0 : 1;
}

void InitLanguages(const TagList& tags) {
    g_PyVersion = tags.GetInt(LANG_PythonVersion, 0);
    g_ThreadSafe = tags.GetBool(LANG_ThreadSafe, true);
    g_OxScript = tags.GetBool(LANG_OwnInterpreter, true);
    if (!g_LuaScriptLanguage) g_LuaScriptLanguage = new LuaScriptLanguage;
    if (!g_Py2ScriptLanguage) g_Py2ScriptLanguage = new Py2ScriptLanguage;
    if (!g_Py3ScriptLanguage) g_Py3ScriptLanguage = new Py3ScriptLanguage;
    bool python2 = g_Py2ScriptLanguage && g_Py2ScriptLanguage->IsAvailable();
    bool python3 = g_Py3ScriptLanguage && g_Py3ScriptLanguage->IsAvailable();
    if (python2 != python3) g_PyVersion = python2 ? 2 : 3;
}

void CleanupLanguages() {
    for (ScriptLanguage** language :
         {&g_LuaScriptLanguage, &g_Py2ScriptLanguage, &g_Py3ScriptLanguage}) {
        if (*language) (*language)->AwaitReturns();
        delete std::exchange(*language, nullptr);
    }
}

void SetDefaultPython(int version) {
    g_PyDefault = version;
}

ScriptLanguage* GetLanguageByExt(const char* ext, bool all) {
    if (!ext) return nullptr;
    if (IsSame(ext, ".lua") || IsSame(ext, ".ondryscript")) return g_LuaScriptLanguage;
    if (IsSame(ext, ".py2")) return GetPython(2, all);
    if (IsSame(ext, ".py3")) return GetPython(3, all);
    return IsSame(ext, ".py") ? GetAnyPython() : nullptr;
}

ScriptLanguage* GetLanguageByName(const char* name, bool all) {
    if (!name) return nullptr;
    if (IsSame(name, "lua")) return g_LuaScriptLanguage;
    if (IsSame(name, "python2") || IsSame(name, "py2")) return GetPython(2, all);
    if (IsSame(name, "python3") || IsSame(name, "py3")) return GetPython(3, all);
    return IsSame(name, "python") ? GetAnyPython() : nullptr;
}

const OxStringT<char>& GetScriptExtensions() {
    static const OxStringT<char>& list = *JoinExtensions();
    return list;
}

}  // namespace Korvel::KorvelScript

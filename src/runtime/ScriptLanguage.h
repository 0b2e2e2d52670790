#pragma once

#include <atomic>

#include "Platform/Event.h"
#include "Platform/Lock.h"
#include "Platform/MinList.h"
#include "core/OxString.h"
#include "core/RefObject.h"
#include "core/TagList.h"

namespace Korvel::KorvelScript {

class ScriptDebug;
class ScriptState;

// Tags of InitLanguages.
constexpr unsigned long long LANG_PythonVersion =
    0x10000000;  // integer; see g_PyVersion. Default 0
constexpr unsigned long long LANG_ThreadSafe =
    0x10000001;  // truth value; see g_ThreadSafe. Default true
constexpr unsigned long long LANG_OwnInterpreter =
    0x10000002;  // truth value; see g_OxScript. Default true

// One scripting language: it makes states, and keeps those that hosts have given back.
//
// Lifetime: InitLanguages makes one object per language, CleanupLanguages destroys them, and with
//           them the states of their pools. No state outlives its language.
// Threads:  any. While one thread makes a state for the pool, and announces it, others that find
//           the pool empty wait. So the setup callback must not wait for one of them.
class KORVEL_EXPORT ScriptLanguage : public RefObject {
public:
    ScriptLanguage() = default;
    ScriptLanguage(const ScriptLanguage&) = delete;
    ScriptLanguage& operator=(const ScriptLanguage&) = delete;
    ~ScriptLanguage() override;

    unsigned int SizeOf() override { return sizeof(ScriptLanguage); }

    // The order of the virtual operations is a contract.

    // A new state that has not been started, with flags STF_; null when there can be none.
    virtual ScriptState* _NewState(ScriptObject* object, unsigned int flags) = 0;
    // A debugger for a state, which then owns it; null where SupportsDebug is false.
    virtual ScriptDebug* _NewDebug(ScriptState* state);
    virtual bool IsAvailable() = 0;
    virtual bool SupportsDebug() { return false; }
    virtual const char* GetName() { return "?"; }
    virtual const char* GetShortName() { return "?"; }

    // The state that has been idle longest, with the globals of its last use, or a new one; the
    // caller's until ScriptState::Done. Null when none can be made. The list is not used.
    virtual ScriptState* GetState(TagList& tags);
    // Takes over a state that is idle; ScriptState::Done is the way to call it.
    virtual void PutState(ScriptState* state);

    // Runs a file in a process of its own, by the tool that StartServer tells of. The process calls
    // this one, which has to be a host, and gets `value`, a table, as its start-up data. 0 when it
    // has been started; else 1, with the reason in the log, also for a name with a double quote.
    virtual int ExecuteFileExternal(const char* file, const ScriptVal& value);
    // What stands between an object and the name of a member that is called.
    virtual const char* GetMemberCallToken() = 0;

    // A new state beside the pool, started unless STF_NoThread says otherwise; the caller's until
    // Done or the last Recycle. The object is not used. Null when none can be made.
    ScriptState* NewState(ScriptObject* object, unsigned int flags);
    ScriptDebug* NewDebug(ScriptState* state) { return _NewDebug(state); }

    // Waits until no state is on its way to the pool any more; before the object is destroyed.
    void AwaitReturns();

private:
    friend class ScriptState;

    ScriptState* TakeIdle();
    bool BeginMaking(ScriptState*& idle);
    void ForgetThread(unsigned long long threadID);

    Lock m_PoolLock;
    MinListT<ScriptState> m_Pool KORVEL_GUARDED_BY(m_PoolLock);
    unsigned long long m_Maker KORVEL_GUARDED_BY(m_PoolLock) = 0;  // thread that makes a state
    Event m_HasMade;
    std::atomic<int> m_NumReturning{0};  // states that are on their way to the pool
};

// The languages; null before InitLanguages.
KORVEL_EXPORT extern ScriptLanguage* g_LuaScriptLanguage;
KORVEL_EXPORT extern ScriptLanguage* g_Py2ScriptLanguage;
KORVEL_EXPORT extern ScriptLanguage* g_Py3ScriptLanguage;

KORVEL_EXPORT extern int g_PyVersion;    // 2 or 3: only that Python; 0: either
KORVEL_EXPORT extern int g_PyDefault;    // which one ".py" and "python" mean when either will do
KORVEL_EXPORT extern bool g_ThreadSafe;  // Python states are switched between threads
KORVEL_EXPORT extern bool g_OxScript;    // this process owns the Python interpreter

// Makes the language objects: Lua, Python 2, Python 3. When exactly one Python is available,
// g_PyVersion becomes that one. Call it once, before other threads use scripts; again only after
// CleanupLanguages.
KORVEL_EXPORT void InitLanguages(const TagList& tags);

// Destroys them. All states must have been given back; it waits for those that are still on their
// way, which may be for ever where a script does not end.
KORVEL_EXPORT void CleanupLanguages();

KORVEL_EXPORT void SetDefaultPython(int version);

// The language for the extension of a file (".lua", ".ondryscript", ".py2", ".py3", ".py") or for a
// name ("lua", "python2" or "py2", "python3" or "py3", "python"), in any case; borrowed. With `all`
// also a Python that g_PyVersion leaves out. Null when there is none. It may be unavailable.
KORVEL_EXPORT ScriptLanguage* GetLanguageByExt(const char* ext, bool all);
KORVEL_EXPORT ScriptLanguage* GetLanguageByName(const char* name, bool all);

// The extensions of the languages that are available, joined by "|". What the first call has found
// stands for the life of the process.
KORVEL_EXPORT const OxStringT<char>& GetScriptExtensions();

}  // namespace Korvel::KorvelScript

#pragma once

#include "runtime/Script.h"
#include "runtime/ScriptLanguage.h"

struct lua_State;

namespace Korvel {

// The state that an interpreter belongs to; null for any other interpreter. For the state's thread.
KORVEL_EXPORT KorvelScript::ScriptState* GetState(lua_State* L);

namespace KorvelScript {

class KORVEL_EXPORT LuaScriptLanguage : public ScriptLanguage {
public:
    unsigned int SizeOf() override { return sizeof(LuaScriptLanguage); }
    ScriptState* _NewState(ScriptObject* object, unsigned int flags) override;
    bool IsAvailable() override { return true; }
    bool SupportsDebug() override { return true; }
    const char* GetName() override { return "Lua"; }
    const char* GetShortName() override { return "Lua"; }
    const char* GetMemberCallToken() override { return ":"; }
};

// A state on an interpreter of its own, made by the constructor and closed by the destructor.
//
// Texts run in the interpreter's globals; a file runs in an environment of its own, through which
// it reads the globals, and writes them by way of the table `globals`. What a text returns, and
// what GetGlobal reads, stays on the interpreter's stack until CollectGarbage or Done.
//
// Threads: the interpreter is used on the state's thread alone, once the state has been made.
// Failure: without memory for an interpreter the language makes no state.
class KORVEL_EXPORT LuaScriptState : public ScriptState {
public:
    LuaScriptState(ScriptLanguage* language, ScriptObject* object, unsigned int flags);
    ~LuaScriptState() override;

    unsigned int SizeOf() override { return sizeof(LuaScriptState); }

    void _EnableDebug(bool enable) override;
    unsigned int _Execute(const char* text, unsigned int flags, const char* name) override;
    unsigned int _ExecuteFile(const char* file, unsigned int flags, const char* name) override;
    // Runs "name(a, b, c)"; the arguments are texts up to a null pointer. Always 0.
    unsigned int _Call(const char* name, const char* first, ...) override;
    void _SetGlobal(const char* name, const ScriptVal& value, unsigned int flags) override;
    void _SetGlobalObject(const char* name, const ScriptObject* object,
                          unsigned long long reference, unsigned int flags) override;
    // A dotted name goes from the globals down; what is missing on the way gives nil.
    unsigned int _GetGlobal(const char* name, ScriptVal& value, unsigned int flags) override;
    unsigned int _GetGlobalType(const char* name, unsigned int flags) override;
    void _SetThisApp(const char* name, const char* shortName) override;
    void _SetArgs(char** argv, int argc) override;
    void _CollectGarbage() override;
    void* _GetRawState() override { return m_Lua; }
    void _Init() override {}
    void _SetPathMap(const ScriptVal& map) override;

private:
    lua_State* Here() const;
    void SetOutcome(lua_State* L, int firstResult);
    unsigned int ReportNoRoom();
    void RefuseName(const char* name);

    lua_State* m_Lua;
};

}  // namespace KorvelScript
}  // namespace Korvel

#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "Platform/Threads.h"
#include "runtime/Script.h"
#include "runtime/ScriptDebug.h"
#include "runtime/ScriptLanguage.h"

namespace Korvel::Test {

using namespace KorvelScript;

// A debugger that notes what it is told.
class FakeDebug : public ScriptDebug {
public:
    explicit FakeDebug(std::string& log) : m_Log(log) {}
    void EnableDebug(bool enable) override { m_Log += enable ? "on " : "off "; }
    void DoStart() override { m_Log += "start "; }
    void DoStop() override { m_Log += "stop "; }
    void DebugHook(DebugHookData*) override { m_Log += "hook "; }
    void CleanUp() override { m_Log += "cleanup "; }

private:
    std::string& m_Log;
};

// A state whose programs are functions of the test: Execute("name") runs the one of that name, on
// the state's thread. Globals are values in a map.
class FakeState : public ScriptState {
public:
    using Program = std::function<unsigned int(FakeState& state)>;

    FakeState(ScriptLanguage* language, ScriptObject* object, unsigned int flags)
        : ScriptState(language, object, flags) {
        s_Alive++;
    }
    ~FakeState() override { s_Alive--; }

    unsigned int _Execute(const char* text, unsigned int, const char*) override {
        m_Executed.push_back(text);
        auto program = m_Programs.find(text);
        return program == m_Programs.end() ? 0 : program->second(*this);
    }
    unsigned int _ExecuteFile(const char* file, unsigned int flags, const char* name) override {
        return _Execute(file, flags, name);
    }
    unsigned int _Call(const char*, const char*, ...) override { return 0; }
    void _SetGlobal(const char* name, const ScriptVal& value, unsigned int) override {
        m_Globals[name] = value;
    }
    void _SetGlobalObject(const char* name, const ScriptObject*, unsigned long long reference,
                          unsigned int) override {
        m_Globals[name] = reference;
    }
    unsigned int _GetGlobal(const char* name, ScriptVal& value, unsigned int) override {
        value = m_Globals[name];
        return 0;
    }
    unsigned int _GetGlobalType(const char* name, unsigned int) override {
        return m_Globals[name].Type();
    }
    void _SetThisApp(const char*, const char*) override {}
    void _SetArgs(char** argv, int argc) override { m_Globals["args"] = argv[argc - 1]; }
    void _CollectGarbage() override { m_Collections++; }
    void* _GetRawState() override { return this; }
    void _Init() override { m_InitThread = Platform::GetCurrentThreadID(); }
    void _SetPathMap(const ScriptVal& map) override { m_Globals["map"] = map; }

    static inline std::atomic<int> s_Alive{0};
    std::map<std::string, Program> m_Programs;  // filled before the program is sent
    std::vector<std::string> m_Executed;
    std::map<std::string, ScriptVal> m_Globals;
    int m_Collections = 0;
    unsigned long long m_InitThread = 0;
};

class FakeLanguage : public ScriptLanguage {
public:
    ScriptState* _NewState(ScriptObject* object, unsigned int flags) override {
        if (m_IsOut) return nullptr;
        return new FakeState(this, object, flags | m_Flags);
    }
    ScriptDebug* _NewDebug(ScriptState*) override { return new FakeDebug(m_DebugLog); }
    bool IsAvailable() override { return true; }
    bool SupportsDebug() override { return m_SupportsDebug; }
    const char* GetMemberCallToken() override { return "->"; }

    FakeState* Get() {
        TagList tags;
        return static_cast<FakeState*>(GetState(tags));
    }
    FakeState* New(unsigned int flags = 0) {
        return static_cast<FakeState*>(NewState(nullptr, flags));
    }

    bool m_IsOut = false;
    bool m_SupportsDebug = false;
    unsigned int m_Flags = 0;  // of every state
    std::string m_DebugLog;
};

}  // namespace Korvel::Test

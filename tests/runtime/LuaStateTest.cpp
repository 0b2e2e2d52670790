// Lua states through what hosts call, and nothing else.
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <vector>

#include "Support.h"
#include "core/RefObject.h"
#include "core/TagList.h"
#include "objects/ObjectReferences.h"
#include "runtime/RuntimeHooksInternal.h"
#include "runtime/Script.h"
#include "runtime/ScriptDebug.h"
#include "runtime/ScriptLanguage.h"
#include "runtime/lua/LuaLanguage.h"

namespace Korvel::KorvelScript {
namespace {

class LuaStateTest : public testing::Test {
public:
    LuaStateTest() {
        InitLanguages(TagList());
        m_State = g_LuaScriptLanguage->NewState(nullptr, 0);
        m_State->SetPrintFuncs(Append<&LuaStateTest::m_Out>, Append<&LuaStateTest::m_Errors>, this);
    }
    ~LuaStateTest() override {
        m_State->Recycle();
        CleanupLanguages();
    }

    template <std::string LuaStateTest::*Where>
    static void Append(void* self, const char* text) {
        static_cast<LuaStateTest*>(self)->*Where += text;
    }

    // What a text prints; a result other than 0 and what was reported stand behind it.
    std::string Run(const std::string& text, unsigned int flags = 0, const char* name = "test") {
        return Take(m_State->Execute(text.c_str(), flags, name));
    }
    std::string RunFile(const std::string& text) {
        return Take(m_State->ExecuteFile(m_Dir.Write("file.lua", text).c_str()));
    }
    std::string Take(unsigned int result) {
        std::string all = m_Out;
        if (result) all += "|" + std::to_string(result);
        if (!m_Errors.empty()) all += "|" + m_Errors;
        m_Out.clear();
        m_Errors.clear();
        return all;
    }
    ScriptVal Get(const char* name) {
        ScriptVal value;
        EXPECT_EQ(m_State->GetGlobal(name, value), 0u);
        return value;
    }

    Korvel::Test::TempDir m_Dir;
    ScriptState* m_State;
    std::string m_Out;
    std::string m_Errors;
};

TEST_F(LuaStateTest, RunsTexts) {
    struct Case {
        const char* m_Text;
        unsigned int m_Flags;
        const char* m_Printed;
    };
    const Case cases[] = {
        {"print()", 0, "\n"},
        {"print(1, 'b', nil, true)", 0, "1\tb\tnil\ttrue\n"},
        {"x = 5", 0, ""},
        {"x + 1", SEXEC_Print, "6\n"},
        {"x -- and a remark", SEXEC_Print, "5\n"},
        {"x, nil", SEXEC_Print | SEXEC_Dump, "5\nnil\n"},
        {"print(setmetatable({}, {__tostring = function() return 1 end}))", 0,
         "|1|[string \"test\"]:1: 'tostring' must return a string to 'print'\n"},
        {"print(setmetatable({}, {__tostring = function() return {} end}))", 0,
         "|1|[string \"test\"]:1: 'tostring' must return a string to 'print'\n"},
        {"if x then", SEXEC_Interactive, "|3"},
        {"x = [[", SEXEC_Interactive, "|3"},
        {"if x then", 0, "|1|[string \"test\"]:1: 'end' expected near '<eof>'\n"},
        {"if then", SEXEC_Interactive, "|1|[string \"test\"]:1: unexpected symbol near 'then'\n"},
        {"error(\"'<eof>'\", 0)", SEXEC_Interactive, "|1|'<eof>'\n"},
        {"error()", 0, "|1|(error object is a nil value)\n"},
        {"error(setmetatable({}, {__tostring = function() return 'told' end}))", 0, "|1|told\n"},
        {"error(setmetatable({}, {__tostring = error}))", 0, "|1|unknown error\n"},
        {"print('\\255a') error('\\255b', 0)", 0, "?a\n|1|?b\n"},
        {"error(setmetatable({}, {__tostring = function() error('\\255x', 0) end}))", 0,
         "|1|unknown error\n"},
        {"_ALERT('told') _ALERT({})", 0, "|told\nunknown error\n"},
        {"os.exit(3, {a = 1})", 0, "|1|\n"},
        {"print(_EXITCODE, _EXITDATA.a, OxPLATFORM_LINUX)", 0, "3\t1\ttrue\n"},
        {"orv.exit('x')", 0, "|1|\n"},
        {"print(_EXITCODE, _EXITDATA)", 0, "0\tnil\n"},
        {"print(ThisApp(), _initffi())", 0, "nil\n"},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(Run(c.m_Text, c.m_Flags), c.m_Printed) << c.m_Text;
    }
    EXPECT_EQ(Run("error('x')", 0, nullptr), "|1|[string \"???\"]:1: x\n");
    EXPECT_EQ(Run("x, 'two'", SEXEC_Dump), "5\ntwo\n");

    Run("local function inner() error('x') end\ninner()");
    EXPECT_NE(strstr(m_State->GetTraceback(), "function 'inner'"), nullptr);
    Run("return 7, 8");
    EXPECT_TRUE(m_State->GetRunResult() == 7);
    EXPECT_TRUE(m_State->GetTraceback().IsEmpty());
    Run("return 'text'");
    EXPECT_TRUE(m_State->GetRunResult().IsNil());
}

TEST_F(LuaStateTest, RunsFilesInAnEnvironmentOfTheirOwn) {
    EXPECT_EQ(RunFile("#!/usr/bin/oxscript\nmine = 1 globals.ours = 2 print(mine, ours) return 4"),
              "1\t2\n");
    EXPECT_TRUE(m_State->GetRunResult() == 4);
    EXPECT_TRUE(Get("mine").IsNil() && Get("ours") == 2);
    EXPECT_NE(RunFile("x = = 1").find("file.lua:1: unexpected symbol"), std::string::npos);
    EXPECT_NE(RunFile("\nlocal x; x.y = 1").find("file.lua:2: attempt to index local 'x'"),
              std::string::npos);
    EXPECT_NE(strstr(m_State->GetTraceback(), "file.lua:2: in"), nullptr);
    std::string missing = Take(m_State->ExecuteFile(m_Dir.Path("none.lua").c_str()));
    EXPECT_NE(missing.find("none.lua: No such file"), std::string::npos) << missing;
    EXPECT_EQ(missing.substr(0, 3), "|1|");
    // Reporting has a way out where the script's own way fails.
    Run("_ALERT = function() error('again') end");
    EXPECT_NE(RunFile("error('first', 0)").find("first\n"), std::string::npos);
    Run("_ALERT, callglob = nil, nil");
    EXPECT_NE(RunFile("").find("attempt to call"), std::string::npos);
    EXPECT_EQ(Run("print('alive')"), "alive\n");
}

TEST_F(LuaStateTest, SetsAndGetsGlobals) {
    ScriptVal table(SV_Table, nullptr);
    table["list"] = "deep";
    m_State->SetGlobal("t", table);
    m_State->SetGlobal("no name = at all", 3);
    EXPECT_EQ(Run("print(t.list, _G['no name = at all'])"), "deep\t3\n");
    Run("a = {b = {c = 5}} f = function() end s = 'x'"
        " trap = setmetatable({}, {__index = function() error('trapped', 0) end})");
    struct Case {
        const char* m_Name;
        ScriptVal m_Value;
        unsigned int m_Type;
    };
    const Case cases[] = {
        {"a.b.c", 5, SV_Number},     {"a.b", ScriptVal(), SV_Table},
        {"a.x.y.z", ScriptVal(), 0}, {"a.b.c.d", ScriptVal(), 0},
        {"nothing", ScriptVal(), 0}, {"f", ScriptVal(), SV_Function},
        {"f.x", ScriptVal(), 0},     {"s", "x", SV_String},
        {"s.x", ScriptVal(), 0},     {nullptr, ScriptVal(), 0},
        {"", ScriptVal(), 0},        {"a..c", ScriptVal(), 0},
    };
    for (const Case& c : cases) {
        ScriptVal value = 1;
        EXPECT_EQ(m_State->GetGlobal(c.m_Name, value), 0u);
        bool isCopy = c.m_Type == SV_Table || c.m_Type == SV_Function;
        EXPECT_TRUE(isCopy || value == c.m_Value) << c.m_Name;
        EXPECT_EQ(m_State->GetGlobalType(c.m_Name), c.m_Type) << c.m_Name;
    }
    EXPECT_TRUE(Get("a")["b"]["c"] == 5 && Get("f").IsCode());

    // What fails on the way is reported, and nobody hangs.
    ScriptVal value = 1;
    EXPECT_EQ(m_State->GetGlobal("trap.x", value), SRES_Failed);
    EXPECT_TRUE(value.IsNil());
    EXPECT_EQ(Take(0), "|trapped\n");
    EXPECT_EQ(m_State->GetGlobalType("trap.x"), static_cast<unsigned int>(SV_Nil));
    Run("setmetatable(_G, {__newindex = function() error('locked', 0) end})");
    m_State->SetGlobal("fresh", 1);
    EXPECT_EQ(Take(0), "|locked\n");
    Run("setmetatable(_G, nil) deep = {} t = deep for i = 1, 300 do t.t = {} t = t.t end");
    EXPECT_EQ(m_State->GetGlobal("deep", value), SRES_Failed);
    EXPECT_NE(Take(0).find("Table nested too deeply."), std::string::npos);
    Run("co = coroutine.create(print)");
    EXPECT_EQ(m_State->GetGlobal("co", value), SRES_Failed);
    EXPECT_NE(Take(0).find("Unsupported type for custom data!"), std::string::npos);
}

TEST_F(LuaStateTest, TakesNamesOnlyThatCanStandInAProgram) {
    for (const char* name :
         {"x = 1; print('pwned')", "", "a.", ".a", "1a", "a b", "a..b", "end", "a.if"}) {
        m_State->SetThisApp(name, nullptr);
        m_State->SetThisApp("fine", name);
        m_State->SetGlobalObject(name, nullptr);
        EXPECT_EQ(m_Out, "");
        EXPECT_NE(Take(0).find("is no name for a global."), std::string::npos) << name;
    }
    Run("ThisApp = nil");  // nobody would answer it
    m_State->SetThisApp("fine.path_1", "short");
    EXPECT_NE(Take(0).find("attempt to call global 'ThisApp' (a nil value)"), std::string::npos);
    // The four halves of the address and the reference arrive whole, whatever `class` makes of
    // them.
    Run("class = {_ScriptObject = function(app, ...) args = {...} return 'made' end}");
    _Object object;
    m_State->SetGlobalObject("o", &object);
    auto address = reinterpret_cast<uint64_t>(&object);
    uint64_t reference = ObjectReferences::GetObjectReference(&object);
    ScriptVal args = Get("args");
    EXPECT_TRUE(Get("o") == "made" && args[1] == (address & 0xffffffff) &&
                args[2] == (address >> 32) && args[3] == (reference & 0xffffffff) &&
                args[4] == (reference >> 32));
}

TEST_F(LuaStateTest, GivesScriptsTheirArguments) {
    char first[] = "a=1=2";
    char second[] = "b";
    char* argv[] = {first, second, nullptr};
    m_State->SetArgs(argv, 2);
    EXPECT_STREQ(first, "a=1=2");  // the host's own
    EXPECT_EQ(Run("print(arg.a, arg[0], arg[1], arg.n)"), "1=2\tb\tnil\t0\n");
    m_State->SetArgs(nullptr, 0);
    EXPECT_EQ(Run("print(arg.n)"), "-1\n");
}

TEST_F(LuaStateTest, MapsSearchPaths) {
    auto before = g_RuntimeHooks.m_MapPaths;
    unsetenv("LUA_PATH");
    unsetenv("LUA_CPATH");
    m_State->SetPathMap(ScriptVal(SV_Table, nullptr));
    std::string unmapped = Run("print(package.path)");
    g_RuntimeHooks.m_MapPaths = [](const char* paths, const ScriptVal& map, OxStringT<char>& out) {
        out = (map.FindKeyConst("root").ToString("") + std::string("/") + paths).c_str();
        return true;
    };
    m_State->SetPathMap(ScriptVal());
    EXPECT_EQ(Run("print(package.path)"), unmapped);
    ScriptVal map(SV_Table, nullptr);
    map["root"] = "R";
    m_State->SetPathMap(map);
    EXPECT_EQ(Run("print(package.path .. '\\n' .. package.cpath)"),
              "R/LuaModules:?.lua;LuaModules:?/init.lua\nR/LuaModules:?.so\n");
    EXPECT_TRUE(m_State->GetPathMap()["root"] == "R");
    setenv("LUA_PATH", "first;;last", 1);
    m_State->SetPathMap(map);
    EXPECT_EQ(Run("print(package.path)"), "first;R/LuaModules:?.lua;LuaModules:?/init.lua;last\n");
    unsetenv("LUA_PATH");
    g_RuntimeHooks.m_MapPaths = before;
}

// Results pile up on the stack until they are collected; that must never overflow it.
TEST_F(LuaStateTest, KeepsResultsUntilCollected) {
    Run("alive = setmetatable({}, {__mode = 'k'}) function make() local t = {} alive[t] = 1"
        " return t end function count() local n = 0 for _ in pairs(alive) do n = n + 1 end"
        " print(n) end");
    Run("return make()");
    Run("collectgarbage() count()");
    EXPECT_EQ(Run("collectgarbage() count()"), "1\n");
    m_State->CollectGarbage();
    EXPECT_EQ(Run("count()"), "0\n");
    for (int i = 0; i < 20000; i++) ASSERT_EQ(m_State->Execute("return 1, 2, 3"), 0u);
    EXPECT_EQ(Run("return unpack({}, 1, 7900)"), "");
    for (int i = 0; i < 9000; i++) EXPECT_TRUE(Get("count").IsCode());
    EXPECT_EQ(Run("print('room')"), "room\n");
}

// A print function that turns to its own state, from the script's main program and from coroutines.
TEST_F(LuaStateTest, AnswersItsOwnPrintFunction) {
    m_State->SetPrintFuncs(
        [](void* user, const char* text) {
            auto* self = static_cast<LuaStateTest*>(user);
            ScriptVal value;
            if (strcmp(text, "ask") == 0) {
                self->m_State->SetGlobal("answer", 41);
                EXPECT_EQ(self->m_State->Execute("answer = answer + 1 return answer"), 0u);
                EXPECT_EQ(self->m_State->GetGlobal("answer", value), 0u);
                EXPECT_TRUE(value == 42);
                self->m_State->CollectGarbage();
                EXPECT_EQ(self->m_State->Execute("error('inner', 0)"), SRES_Failed);
            } else if (strcmp(text, "throw") == 0) {
                throw std::runtime_error("thrown by the host");
            } else {
                self->m_Out += text;
            }
        },
        Append<&LuaStateTest::m_Errors>, this);
    EXPECT_EQ(Run("local a, b = 1, 2 print('ask', a, b) return answer"), "\t1\t2\n|inner\n");
    EXPECT_TRUE(m_State->GetRunResult() == 42);
    EXPECT_EQ(Run("local co = coroutine.wrap(function() local a = 1 print('ask')"
                  " coroutine.yield(a) return 2 end) print(co(), co())"),
              "\n1\t2\n|inner\n");
    EXPECT_EQ(Run("print(pcall(print, 'throw'))"), "false\tthrown by the host\n");
    EXPECT_EQ(Run("print('throw')"), "|1|[string \"test\"]:1: thrown by the host\n");
}

// An error function may turn to its own state as well, and may fail.
TEST_F(LuaStateTest, SurvivesItsErrorFunction) {
    m_State->SetPrintFuncs(
        Append<&LuaStateTest::m_Out>,
        [](void* user, const char* text) {
            auto* self = static_cast<LuaStateTest*>(user);
            std::string before = text;
            self->m_State->CollectGarbage();
            self->m_State->Execute("x = string.rep('y', 100) return 7");
            EXPECT_EQ(before, text);
            self->m_Errors += text;
            if (strstr(text, "throw")) throw std::runtime_error("thrown by the host");
        },
        this);
    EXPECT_EQ(Run("local a = 'told' error(a .. ' late', 0)"), "|1|told late\n");
    EXPECT_TRUE(m_State->GetRunResult().IsNil());
    EXPECT_NE(strstr(m_State->GetTraceback(), "in main chunk"), nullptr);
    EXPECT_EQ(RunFile("error('told by a file', 0)"), "|1|told by a file\n");
    EXPECT_NE(strstr(m_State->GetTraceback(), "file.lua:1"), nullptr);
    EXPECT_EQ(Run("error('throw', 0)"), "|1|throw");
    EXPECT_EQ(Run("_ALERT('throw')"), "|1|throw[string \"test\"]:1: thrown by the host");
    EXPECT_EQ(Run("_ALERT = nil"), "");
    EXPECT_EQ(RunFile("error('throw', 0)"), "|1|throw");
    // There is no room for an entry in the middle of a full stack.
    m_State->SetPrintFuncs(
        [](void* user, const char* text) {
            auto* self = static_cast<LuaStateTest*>(user);
            self->m_State->SetGlobal("never", 1);
            self->m_Out += text;
        },
        Append<&LuaStateTest::m_Errors>, this);
    std::string full = Run("print('first', unpack({}, 1, 7985))");
    EXPECT_EQ(full.substr(0, 10), "first\tnil\t") << full.substr(0, 100);
    EXPECT_NE(full.find("The script's stack is full."), std::string::npos);
    EXPECT_EQ(Run("print(never)"), "nil\n");
}

// The loop is compiled before anybody asks for its lines.
TEST_F(LuaStateTest, DebugsCompiledLoops) {
    static int hooks;
    hooks = 0;
    class Counter : public ScriptDebug {
        void DebugHook(DebugHookData* data) override { hooks += data != nullptr; }
    };
    class CountingLanguage : public LuaScriptLanguage {
        ScriptDebug* _NewDebug(ScriptState*) override { return new Counter; }
    } language;
    ScriptState* state = language.NewState(nullptr, 0);
    EXPECT_EQ(state->Execute("function spin() local n = 0 for i = 1, 1e5 do n = n + i end end"
                             " spin() assert(jit.status() and not debug.gethook())"),
              0u);
    state->EnableDebug(true);
    EXPECT_TRUE(state->IsDebug());
    EXPECT_EQ(state->Execute("spin() assert(not jit.status())"), 0u);
    EXPECT_GT(hooks, 100000);
    state->EnableDebug(false);
    hooks = 0;
    EXPECT_EQ(state->Execute("spin() assert(jit.status() and not debug.gethook())"), 0u);
    EXPECT_EQ(hooks, 0);
    state->Recycle();
}

TEST_F(LuaStateTest, SwitchesItsTrace) {
    Run("_setdebugtransport(1)");
    EXPECT_NE(m_State->GetFlags(STF_Trace), 0u);
    testing::internal::CaptureStdout();
    Run("_setdebugtransport(false)");
    EXPECT_NE(testing::internal::GetCapturedStdout(), "");
    EXPECT_EQ(m_State->GetFlags(STF_Trace), 0u);
}

TEST_F(LuaStateTest, StatesAreApart) {
    constexpr int kStates = 64;
    std::vector<ScriptState*> states;
    for (int i = 0; i < kStates; i++) {
        states.push_back(g_LuaScriptLanguage->NewState(nullptr, 0));
        states[i]->SetGlobal("n", i, SEXEC_NoWait);
        states[i]->Execute("local s = 0 for i = 1, 1e5 do s = s + n end sum = s", SEXEC_NoWait);
    }
    for (int i = 0; i < kStates; i++) {
        ScriptVal sum;
        states[i]->GetGlobal("sum", sum);
        EXPECT_TRUE(sum == i * 1e5);
        states[i]->Done();
    }
    TagList tags;
    for (int round = 0; round < 20; round++) {
        ScriptState* pooled = g_LuaScriptLanguage->GetState(tags);
        EXPECT_EQ(pooled->Execute("assert(sum)"), 0u);
        ScriptState* fresh = g_LuaScriptLanguage->NewState(nullptr, 0);
        EXPECT_EQ(fresh->Execute("assert(not sum) return {}"), 0u);
        if (round % 2) {
            pooled->Recycle();
            fresh->Done(SEXEC_NoWait);
        } else {
            fresh->Shutdown(60, nullptr, nullptr);
            fresh->Recycle();
            pooled->Done();
        }
    }
}

}  // namespace
}  // namespace Korvel::KorvelScript

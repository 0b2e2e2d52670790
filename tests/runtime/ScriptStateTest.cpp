// States and languages without a real interpreter.
#include <gtest/gtest.h>

#include <memory>
#include <stdexcept>
#include <thread>

#include "FakeLanguage.h"
#include "Platform/Threads.h"
#include "Platform/Time.h"
#include "core/ScriptHooksInternal.h"
#include "core/TagList.h"
#include "objects/ObjectReferences.h"
#include "runtime/RuntimeHooksInternal.h"

namespace Korvel::KorvelScript {
namespace {

using Test::FakeLanguage;
using Test::FakeState;

constexpr int kLimitMs = 60000;  // no test comes near

class ScriptStateTest : public testing::Test {
protected:
    ~ScriptStateTest() override {
        m_Language.reset();
        EXPECT_EQ(FakeState::s_Alive, 0);
    }

    std::unique_ptr<FakeLanguage> m_Language = std::make_unique<FakeLanguage>();
};

TEST_F(ScriptStateTest, KeepsEachSendersOrder) {
    constexpr int kSenders = 8;
    constexpr int kMessages = 12500;
    struct Counted : ScriptMessage {
        Counted(int sender, int number) : ScriptMessage(SMSG_SetGlobal), m_Number(number) {
            m_Name = OxID(std::to_string(sender).c_str(), true);
            m_Value = number;
        }
        int m_Number;
    };
    class Checker : public FakeState {
    public:
        using FakeState::FakeState;
        void _SetGlobal(const char* name, const ScriptVal& value, unsigned int) override {
            int& last = m_Last[atoi(name)];
            m_IsInOrder &= value == ++last;
        }
        int m_Last[kSenders] = {};
        bool m_IsInOrder = true;
    };
    struct CheckerLanguage : FakeLanguage {
        ScriptState* _NewState(ScriptObject*, unsigned int flags) override {
            return new Checker(this, nullptr, flags);
        }
    } language;
    auto* state = static_cast<Checker*>(language.NewState(nullptr, 0));
    std::vector<std::thread> senders;
    for (int sender = 0; sender < kSenders; sender++) {
        senders.emplace_back([=] {
            for (int i = 1; i <= kMessages; i++) {
                unsigned int flags = i % 100 ? SEXEC_NoWait : 0;
                state->DoMessage(new Counted(sender, i), flags, true);
            }
        });
    }
    for (std::thread& sender : senders) sender.join();
    for (int last : state->m_Last) EXPECT_EQ(last, kMessages);
    EXPECT_TRUE(state->m_IsInOrder);
    state->Recycle();
}

TEST_F(ScriptStateTest, SyncTellsThatAllBeforeHasBeenHandled) {
    FakeState* state = m_Language->New();
    Event gate;
    state->m_Programs["hold"] = [&](FakeState&) { return gate.Wait(kLimitMs) ? 0u : 1u; };
    state->Execute("hold", SEXEC_NoWait);
    state->Execute("next", SEXEC_NoWait);
    EventQueue target;
    EXPECT_EQ(state->Sync(&target), 1u);
    EXPECT_EQ(state->Sync(&target), 2u);
    EXPECT_EQ(target.Get(), nullptr);
    gate.Signal();
    for (unsigned int number = 1; number <= 2; number++) {
        SyncMessage* sync;
        while (!(sync = static_cast<SyncMessage*>(target.Get())))
            ASSERT_TRUE(target.Wait(kLimitMs));
        EXPECT_EQ(sync->m_Number, number);
        EXPECT_EQ(sync->m_State, state);
        sync->Reply();
    }
    EXPECT_EQ(state->m_Executed.size(), 2u);
    state->Recycle();
}

TEST_F(ScriptStateTest, PassesWhatMessagesCarry) {
    FakeState* state = m_Language->New();
    state->m_Programs["three"] = [](FakeState&) { return 3u; };
    state->m_Programs["throws"] = [](FakeState&) -> unsigned int {
        throw std::runtime_error("a callback of the host's");
    };
    EXPECT_EQ(state->Execute("three"), SRES_Incomplete);
    EXPECT_EQ(state->ExecuteFile("three"), SRES_Incomplete);
    EXPECT_EQ(state->Execute("three", SEXEC_NoWait), 0u);
    EXPECT_EQ(state->Call("three", nullptr), 1u);

    testing::internal::CaptureStderr();
    EXPECT_EQ(state->Execute("throws"), SRES_Failed);
    EXPECT_NE(testing::internal::GetCapturedStderr().find("a callback of the host's"),
              std::string::npos);

    std::string errors;
    state->SetPrintFuncs(
        nullptr, [](void* data, const char* text) { *static_cast<std::string*>(data) += text; },
        &errors);
    EXPECT_EQ(state->Execute(nullptr), SRES_Failed);
    EXPECT_EQ(state->ExecuteFile(nullptr), SRES_Failed);
    EXPECT_EQ(errors, "There is no text to execute.\nThere is no file name to execute.\n");

    state->SetGlobal("x", 5, SEXEC_NoWait);
    ScriptVal value;
    EXPECT_EQ(state->GetGlobal("x", value), 0u);
    EXPECT_TRUE(value == 5);
    EXPECT_EQ(state->GetGlobalType("x"), static_cast<unsigned int>(SV_Number));
    _Object object;
    state->SetGlobalObject("o", &object);
    EXPECT_TRUE(state->m_Globals["o"] ==
                static_cast<double>(ObjectReferences::GetObjectReference(&object)));
    char arg[] = "last";
    char* argv[] = {arg, nullptr};
    state->SetArgs(argv, 1);
    EXPECT_TRUE(state->m_Globals["args"] == "last");
    state->SetPathMap("somewhere");
    state->CollectGarbage();
    EXPECT_TRUE(state->GetPathMap() == "somewhere" && state->m_Globals["map"] == "somewhere");
    EXPECT_EQ(state->m_Collections, 1);

    ScriptMessage own(SMSG_Call);  // has no handler
    EXPECT_EQ(state->DoMessage(&own, 0, false), 0u);
    state->LockStateData()["k"] = 1;
    state->UnlockStateData();
    EXPECT_TRUE(state->LockStateData()["k"] == 1);
    state->Recycle();
}

TEST_F(ScriptStateTest, ThePoolKeepsWhatHasBeenDone) {
    FakeState* first = m_Language->Get();
    FakeState* second = m_Language->Get();
    EXPECT_NE(first, second);
    EXPECT_NE(first->GetFlags(STF_Announce), 0u);
    first->SetGlobal("mine", 1);
    EXPECT_EQ(first->Done(), 0u);
    EXPECT_EQ(first->Done(), SRES_Failed);
    EXPECT_EQ(first->Done(SEXEC_NoWait), SRES_Failed);
    EXPECT_EQ(second->Done(), 0u);
    EXPECT_EQ(first->m_Collections, 1);

    FakeState* other = m_Language->New();
    other->Done();
    EXPECT_EQ(m_Language->Get(), first);
    EXPECT_TRUE(first->m_Globals["mine"] == 1);
    EXPECT_EQ(m_Language->Get(), second);
    EXPECT_EQ(m_Language->Get(), other);
    second->Done();
    first->Done(SEXEC_NoWait);
    first->Execute("");  // behind it
    // A state that has ended is not given out again, and cannot be given back.
    second->Shutdown(60, nullptr, nullptr);
    other->Shutdown(60, nullptr, nullptr);
    EXPECT_EQ(other->Done(), SRES_Failed);
    other->Recycle();
    EXPECT_EQ(m_Language->Get(), first);
    first->Recycle();

    m_Language->m_IsOut = true;
    EXPECT_EQ(m_Language->Get(), nullptr);
    EXPECT_EQ(m_Language->New(), nullptr);
}

TEST_F(ScriptStateTest, TellsTheHostOfEachStage) {
    static std::vector<int> stages;
    static unsigned long long thread;
    stages.clear();
    ScriptConfig config;
    config.Setup = [](ScriptState*, eSCSetupState stage, void*, TagList*) {
        stages.push_back(static_cast<int>(stage));
        thread = Platform::GetCurrentThreadID();
    };
    g_ScriptConfig = &config;
    FakeState* state = m_Language->Get();
    EXPECT_EQ(stages, (std::vector<int>{1, 3}));
    EXPECT_EQ(thread, Platform::GetCurrentThreadID());
    state->Done();
    m_Language->Get();
    state->Execute("");
    EXPECT_NE(state->m_InitThread, Platform::GetCurrentThreadID());
    m_Language->New()->Recycle();
    state->Use();
    state->Recycle();
    EXPECT_EQ(stages, (std::vector<int>{1, 3, 1, 2}));
    state->Recycle();
    EXPECT_EQ(stages, (std::vector<int>{1, 3, 1, 2, 2}));
    g_ScriptConfig = nullptr;
}

// Calls that come back to the state's own thread cannot wait for it.
TEST_F(ScriptStateTest, HandlesCallsOfItsOwnThreadAtOnce) {
    FakeState* state = m_Language->New();
    state->m_Programs["asks"] = [](FakeState& self) {
        ScriptVal value;
        self.SetGlobal("a", 7);
        EXPECT_EQ(self.GetGlobal("a", value), 0u);
        EXPECT_TRUE(self.IsDebug() == false && value == 7);
        return self.Execute("inner");
    };
    state->m_Programs["inner"] = [](FakeState&) { return 9u; };
    EXPECT_EQ(state->Execute("asks"), 9u);

    // A state that lets go of itself goes when it is through, and nobody waits in vain.
    Event entered;
    Event gate;
    state->m_Programs["goes"] = [&](FakeState& self) {
        entered.Signal();
        gate.Wait(kLimitMs);
        self.Recycle();
        return 4u;
    };
    unsigned int went = 0;
    std::thread waiter([&] { went = state->Execute("goes"); });
    ASSERT_TRUE(entered.Wait(kLimitMs));
    state->SetGlobal("behind", ScriptVal("nobody handles it"), SEXEC_NoWait);
    gate.Signal();
    waiter.join();
    EXPECT_EQ(went, 4u);
    for (int i = 0; FakeState::s_Alive && i < kLimitMs; i++) Platform::Wait(1);
    ASSERT_EQ(FakeState::s_Alive, 0);

    state = m_Language->New();
    state->m_Programs["ends"] = [](FakeState& self) {
        self.Shutdown(60, nullptr, nullptr);
        return 0u;
    };
    EXPECT_EQ(state->Execute("ends"), 0u);
    state->Shutdown(60, nullptr, nullptr);
    EXPECT_EQ(state->Execute("later"), SRES_Failed);
    state->Recycle();
}

TEST_F(ScriptStateTest, RunsOnAThreadOfTheHost) {
    m_Language->m_Flags = STF_NoThread;
    FakeState* state = m_Language->Get();
    EXPECT_TRUE(state->IsNoThread() && !state->IsRunning());
    state->Execute("waits for the thread", SEXEC_NoWait);
    std::thread thread([&] { EXPECT_EQ(state->Run(), 0); });
    EXPECT_EQ(state->Execute("text"), 0u);
    state->Shutdown(0, nullptr, nullptr);
    thread.join();
    EXPECT_EQ(state->m_Executed.size(), 2u);
    EXPECT_EQ(state->Execute("text"), SRES_Failed);
    state->Recycle();

    state = m_Language->New();
    thread = std::thread([&] { state->Run(); });
    state->Execute("text");
    state->Recycle();  // ends Run
    thread.join();

    state = m_Language->New();
    state->m_Programs["goes"] = [](FakeState& self) {
        self.Recycle();
        return 0u;
    };
    state->Execute("goes", SEXEC_NoWait);
    state->Run();  // here, and the state goes with it
    EXPECT_EQ(FakeState::s_Alive, 0);
    m_Language->New()->Recycle();  // never run
}

TEST_F(ScriptStateTest, RefusesWhatComesBehindItsEnd) {
    FakeState* state = m_Language->New();
    Event entered;
    Event gate;
    state->m_Programs["hold"] = [&](FakeState&) {
        entered.Signal();
        gate.Wait(kLimitMs);
        return 0u;
    };
    state->Execute("hold", SEXEC_NoWait);
    ASSERT_TRUE(entered.Wait(kLimitMs));
    ScriptMessage* quit = new ScriptMessage(SMSG_Quit);
    state->DoMessage(quit, SEXEC_NoWait, true);
    unsigned int result = 0;
    std::thread waiter([&] { result = state->Execute("too late"); });
    state->SetGlobal("also", ScriptVal("too late"), SEXEC_NoWait);
    gate.Signal();
    waiter.join();
    EXPECT_EQ(result, SRES_Failed);
    int pumped = 0;
    auto pump = [](ScriptState*, void* user) { ++*static_cast<int*>(user); };
    state->Shutdown(60, pump, &pumped);
    pumped = 0;
    state->Shutdown(60, pump, &pumped);  // the thread has ended
    EXPECT_EQ(pumped, 0);
    ScriptVal value = 1;
    EXPECT_EQ(state->GetGlobal("x", value), SRES_Failed);
    EXPECT_TRUE(value.IsNil());
    EXPECT_EQ(state->m_Executed, std::vector<std::string>{"hold"});
    state->Recycle();
}

TEST_F(ScriptStateTest, ServesItsDebugger) {
    FakeState* state = m_Language->New();
    EXPECT_FALSE(state->IsDebugAvailable());
    state->EnableDebug(true);
    EXPECT_FALSE(state->IsDebug());
    EXPECT_EQ(state->ObtainDebug(), nullptr);
    state->ReleaseDebug(nullptr);

    m_Language->m_SupportsDebug = true;
    EXPECT_TRUE(state->IsDebugAvailable());
    ScriptDebug* debug = state->ObtainDebug();
    EXPECT_NE(debug, nullptr);
    EXPECT_FALSE(state->IsDebugAvailable());
    EXPECT_EQ(state->ObtainDebug(), nullptr);
    state->Execute("");
    state->EnableDebug(true);
    EXPECT_TRUE(state->IsDebug());
    state->Execute("");
    state->DebugHook(nullptr);
    state->EnableDebug(false);
    state->Execute("");
    state->ReleaseDebug(debug);
    EXPECT_EQ(state->ObtainDebug(), debug);
    state->Recycle();
    EXPECT_EQ(m_Language->m_DebugLog, "on start stop hook off cleanup ");
}

TEST_F(ScriptStateTest, TracesItsMessages) {
    FakeState* state = m_Language->New();
    char head[64];
    snprintf(head, sizeof(head),
             "\nScr %p: ", static_cast<void*>(static_cast<ScriptState*>(state)));
    state->SetFlags(STF_Trace);
    testing::internal::CaptureStdout();
    state->Execute("text");
    std::string trace = testing::internal::GetCapturedStdout();
    EXPECT_EQ(trace.find(head), 0u) << trace;
    EXPECT_NE(trace.find(":SMSG_Execute \"text\"\n"), std::string::npos) << trace;
    EXPECT_NE(trace.find(": Reply "), std::string::npos) << trace;
    state->ClearFlags(STF_Trace);
    testing::internal::CaptureStdout();
    state->Execute("text");
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
    state->Recycle();
}

// The connection of the application follows the state, and is held meanwhile.
TEST_F(ScriptStateTest, KeepsItsConnectionInStep) {
    static std::string log;
    log.clear();
    static int uses;
    uses = 0;
    ScriptHooks hooks = g_ScriptHooks;
    RuntimeHooks runtimeHooks = g_RuntimeHooks;
    g_ScriptHooks.m_UseApp = [](RemoteApp*) { uses++; };
    g_ScriptHooks.m_RecycleApp = [](RemoteApp*) { uses--; };
    g_ScriptHooks.m_GetRemoteApp = [](RemoteObject* proxy) {
        return reinterpret_cast<RemoteApp*>(proxy);
    };
    g_ScriptHooks.m_IncRemoteRef = [](RemoteObject*) {};
    g_ScriptHooks.m_DecRemoteRef = [](RemoteObject*) {};
    g_RuntimeHooks.m_SetAppTrace = [](RemoteApp*, bool trace) { log += trace ? "on " : "off "; };
    g_RuntimeHooks.m_SetStateData = [](RemoteApp*, const ScriptVal& data) {
        log += data.FindKeyConst("k").ToString("?");
    };
    FakeState* state = m_Language->New();
    auto* proxy = reinterpret_cast<RemoteObject*>(&log);  // nobody looks into it
    state->m_Globals["app"] = ScriptVal(SV_RemoteObject, &proxy);
    state->SetFlags(STF_Trace);
    testing::internal::CaptureStdout();
    state->SetThisApp("app", nullptr);
    testing::internal::GetCapturedStdout();
    state->ClearFlags(STF_Trace);
    state->SetFlags(0x100);
    state->LockStateData()["k"] = "data";
    state->UnlockStateData();
    EXPECT_EQ(log, "on off data");
    EXPECT_EQ(uses, 1);
    state->m_Globals.clear();
    state->Recycle();
    EXPECT_EQ(uses, 0);
    g_ScriptHooks = hooks;
    g_RuntimeHooks = runtimeHooks;
}

TEST(ScriptLanguages, AreFoundByNameAndExtension) {
    TagList tags;
    tags.Add(LANG_PythonVersion, 3);
    InitLanguages(tags);
    struct Case {
        ScriptLanguage* (*m_Find)(const char*, bool);
        const char* m_Text;
        int m_Version;
        int m_Default;
        ScriptLanguage* m_Found;
        ScriptLanguage* m_FoundOfAll;
    };
    ScriptLanguage* lua = g_LuaScriptLanguage;
    ScriptLanguage* py2 = g_Py2ScriptLanguage;
    ScriptLanguage* py3 = g_Py3ScriptLanguage;
    EXPECT_EQ(g_PyVersion, 3);
    EXPECT_TRUE(lua->IsAvailable() && !py2->IsAvailable() && !py3->IsAvailable());
    EXPECT_EQ(py3->NewState(nullptr, 0), nullptr);
    const Case cases[] = {
        {GetLanguageByExt, ".Lua", 0, 3, lua, lua},
        {GetLanguageByExt, ".ondryscript", 0, 3, lua, lua},
        {GetLanguageByExt, "lua", 0, 3, nullptr, nullptr},
        {GetLanguageByExt, ".PY", 0, 3, py3, py3},
        {GetLanguageByExt, ".py", 0, 2, py2, py2},
        {GetLanguageByExt, ".py", 0, 4, nullptr, nullptr},
        {GetLanguageByExt, ".py", 2, 3, py2, py2},
        {GetLanguageByExt, ".py2", 3, 3, nullptr, py2},
        {GetLanguageByExt, ".py2", 0, 3, py2, py2},
        {GetLanguageByExt, ".py3", 2, 3, nullptr, py3},
        {GetLanguageByExt, nullptr, 0, 3, nullptr, nullptr},
        {GetLanguageByName, "LUA", 0, 3, lua, lua},
        {GetLanguageByName, "python", 0, 2, py2, py2},
        {GetLanguageByName, "Py2", 3, 3, nullptr, py2},
        {GetLanguageByName, "Python3", 0, 2, py3, py3},
        {GetLanguageByName, ".lua", 0, 3, nullptr, nullptr},
        {GetLanguageByName, nullptr, 0, 3, nullptr, nullptr},
    };
    for (const Case& c : cases) {
        g_PyVersion = c.m_Version;
        SetDefaultPython(c.m_Default);
        EXPECT_EQ(c.m_Find(c.m_Text, false), c.m_Found) << c.m_Text << c.m_Version;
        EXPECT_EQ(c.m_Find(c.m_Text, true), c.m_FoundOfAll) << c.m_Text << c.m_Version;
    }
    EXPECT_STREQ(GetScriptExtensions(), ".lua");
    EXPECT_EQ(lua->ExecuteFileExternal("x.lua", 1), 1);
    EXPECT_STREQ(lua->GetMemberCallToken(), ":");
    EXPECT_STREQ(py2->GetMemberCallToken(), ".");
    SetDefaultPython(3);
    CleanupLanguages();
    EXPECT_EQ(GetLanguageByName("lua", false), nullptr);
}

}  // namespace
}  // namespace Korvel::KorvelScript

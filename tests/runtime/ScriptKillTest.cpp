// States whose thread has to be killed.
#include <gtest/gtest.h>

#include <memory>
#include <thread>

#include "FakeLanguage.h"
#include "core/TagList.h"

namespace Korvel::KorvelScript {
namespace {

using Test::FakeLanguage;
using Test::FakeState;

constexpr unsigned int kLimitMs = 60000;

TEST(ScriptStateKill, AnswersEverybodyAndGoesOn) {
    auto language = std::make_unique<FakeLanguage>();
    const int others = FakeState::s_Alive;  // those of an earlier run stay for ever
    FakeState* state = language->Get();
    Event entered;
    state->m_Programs["for ever"] = [&](FakeState&) -> unsigned int {
        entered.Signal();
        for (volatile bool forEver = true; forEver;) {
        }
        return 0;
    };
    unsigned int results[3] = {9, 9, 9};
    bool isDebug = true;
    std::vector<std::thread> waiters;
    waiters.emplace_back([&] { results[0] = state->Execute("for ever"); });
    ASSERT_TRUE(entered.Wait(kLimitMs));
    waiters.emplace_back([&] { results[1] = state->Execute("behind"); });
    waiters.emplace_back([&] {
        ScriptVal value = 1;
        results[2] = state->GetGlobal("x", value);
        EXPECT_TRUE(value.IsNil());
    });
    waiters.emplace_back([&] { isDebug = state->IsDebug(); });
    state->SetGlobal("x", "posted", SEXEC_NoWait);
    int pumped = 0;
    state->Shutdown(
        0.1, [](ScriptState*, void* user) { ++*static_cast<int*>(user); }, &pumped);
    for (std::thread& waiter : waiters) waiter.join();
    for (unsigned int result : results) EXPECT_EQ(result, SRES_Failed);
    EXPECT_FALSE(isDebug);
    EXPECT_GE(pumped, 2);
    EXPECT_TRUE(state->HasEnded() && !state->IsRunning());

    EXPECT_EQ(state->Execute("later"), SRES_Failed);
    EXPECT_FALSE(state->IsDebug());
    state->ReleaseDebug(nullptr);
    EXPECT_EQ(state->Done(), SRES_Failed);
    state->Shutdown(0, nullptr, nullptr);
    EXPECT_EQ(state->m_Executed, std::vector<std::string>{"for ever"});
    state->Recycle();
    EXPECT_EQ(FakeState::s_Alive, others + 1);  // it stays

    // Killed in the pool, with a program that nobody waits for.
    FakeState* other = language->Get();
    other->m_Programs["for ever"] = [](FakeState& self) -> unsigned int {
        self.Done(SEXEC_NoWait);
        self.GetLanguage()->PutState(&self);
        for (volatile bool forEver = true; forEver;) {
        }
        return 0;
    };
    other->Execute("for ever", SEXEC_NoWait);
    other->Shutdown(0, nullptr, nullptr);
    FakeState* fresh = language->Get();
    EXPECT_NE(fresh, other);
    EXPECT_EQ(fresh->Execute(""), 0u);
    fresh->Done();
    language.reset();
    EXPECT_EQ(FakeState::s_Alive, others + 2);
}

// A thread that is killed while it makes a state, or waits for another one, holds up nobody.
TEST(ScriptStateKill, LeavesThePoolUsable) {
    auto language = std::make_unique<FakeLanguage>();
    FakeState* waitedFor = language->New();
    FakeState* state = language->New();
    static Event entered;
    static std::atomic<bool> stalls;
    stalls = true;
    ScriptConfig config;
    config.Setup = [](ScriptState*, eSCSetupState stage, void*, TagList*) {
        if (stage != SCSETUP_Started || !stalls) return;
        entered.Signal();
        while (stalls) {
        }
    };
    g_ScriptConfig = &config;
    state->m_Programs["takes"] = [&](FakeState&) -> unsigned int {
        language->Get();
        return 0;
    };
    state->Execute("takes", SEXEC_NoWait);
    ASSERT_TRUE(entered.Wait(kLimitMs));
    state->Shutdown(0, nullptr, nullptr);
    stalls = false;
    FakeState* fresh = language->Get();
    ASSERT_NE(fresh, nullptr);
    fresh->Done();
    state->Recycle();

    // The killed thread waits in Done, with a text on its stack in the other's queue.
    Event gate;
    waitedFor->m_Programs["hold"] = [&](FakeState&) { return gate.Wait(kLimitMs) ? 0u : 1u; };
    waitedFor->Execute("hold", SEXEC_NoWait);
    state = language->New();
    state->m_Programs["waits"] = [&](FakeState&) -> unsigned int {
        char text[] = "the text";
        entered.Signal();
        return waitedFor->Execute(text) + waitedFor->Done();
    };
    state->Execute("waits", SEXEC_NoWait);
    ASSERT_TRUE(entered.Wait(kLimitMs));
    state->Shutdown(0, nullptr, nullptr);
    gate.Signal();
    state->Recycle();
    waitedFor->Execute("last");
    for (const std::string& text : waitedFor->m_Executed) {
        EXPECT_TRUE(text == "hold" || text == "the text" || text == "last") << text;
    }
    waitedFor->Recycle();
    g_ScriptConfig = nullptr;
    language.reset();
}

// A compiled loop, with a state of the pool.
TEST(ScriptStateKill, EndsALuaScript) {
    InitLanguages(TagList());
    TagList tags;
    ScriptState* state = g_LuaScriptLanguage->GetState(tags);
    unsigned int result = 0;
    Event entered;
    state->SetPrintFuncs([](void* event, const char*) { static_cast<Event*>(event)->Signal(); },
                         nullptr, &entered);
    std::thread waiter([&] { result = state->Execute("print() while true do end"); });
    ASSERT_TRUE(entered.Wait(kLimitMs));
    state->Shutdown(0.1, nullptr, nullptr);
    waiter.join();
    EXPECT_EQ(result, SRES_Failed);
    EXPECT_EQ(state->Execute("x = 1"), SRES_Failed);
    state->Recycle();
    state = g_LuaScriptLanguage->GetState(tags);
    EXPECT_EQ(state->Execute("x = 1"), 0u);
    state->Done();
    CleanupLanguages();
}

}  // namespace
}  // namespace Korvel::KorvelScript

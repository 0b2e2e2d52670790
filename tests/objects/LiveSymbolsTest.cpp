// Function values: which addresses may be called, and on what.
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include "core/FaultsInternal.h"
#include "core/RefObject.h"
#include "core/SpinLockInternal.h"
#include "objects/LiveSymbolsInternal.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"

namespace {

using namespace Korvel;

class Animal : public Scripted<_Object> {
    KORVEL_SCRIPTED(Animal)
public:
    Animal() { SetScriptClass(); }
};

KORVEL_PUBLISH(Animal, "Animal", "", "")
KORVEL_FUNCTION(Animal, Eat, 0) {}
KORVEL_FUNCTION(Animal, Trace, SSF_Debug) {}
KORVEL_PUBLISHED(Animal);

class Bird : public Animal {
    KORVEL_SCRIPTED(Bird)
public:
    Bird() { SetScriptClass(); }
};

KORVEL_PUBLISH(Bird, "Bird", "", "")
KORVEL_FUNCTION(Bird, Fly, 0) {}
KORVEL_CREATE(Bird, 0) {}
KORVEL_PUBLISHED(Bird);

bool MayCall(const ScriptSymbol* symbol, const ScriptObject& object) {
    return bool(HeldSymbol(reinterpret_cast<uint64_t>(symbol), object));
}

TEST(LiveSymbols, AreCalledOnObjectsOfTheirClass) {
    Animal animal;
    Bird bird;
    _Object bare;
    ScriptSymbol* eat = __ScriptInfo_Animal.FindSymbol("Eat", 0);
    ScriptSymbol* fly = __ScriptInfo_Bird.FindSymbol("Fly", 0);
    ScriptSymbol* create = __ScriptInfo_Bird.GetOpcode(SST_Create);
    EXPECT_TRUE(MayCall(eat, animal) && MayCall(eat, bird) && MayCall(fly, bird));
    EXPECT_FALSE(MayCall(fly, animal) || MayCall(eat, bare));
    EXPECT_TRUE(MayCall(create, animal) && MayCall(create, bare));
    EXPECT_FALSE(MayCall(bird.GetScriptInfo()->FindSymbol(nullptr, SST_CallFunction), bird))
        << "it would call itself";

    static bool s_IsDebug;
    ScriptConfig config;
    config.IsDebugMode = [](void*, TagList*) { return s_IsDebug; };
    ScriptSymbol* trace = nullptr;
    for (ScriptSymbol& symbol : __ScriptInfo_Animal.GetSymbols()) {
        if (symbol.GetName() == "Trace") trace = &symbol;
    }
    g_ScriptConfig = &config;
    for (bool isDebug : {false, true}) {
        s_IsDebug = isDebug;
        EXPECT_EQ(MayCall(trace, bird), isDebug);
    }
    g_ScriptConfig = nullptr;
}

// None of these addresses may be read.
TEST(LiveSymbols, UnknownAddressesAreLeftAlone) {
    Bird bird;
    std::mt19937_64 random(3);
    auto known = reinterpret_cast<uint64_t>(__ScriptInfo_Bird.FindSymbol("Fly", 0));
    std::vector<uint64_t> addresses = {0, 1, 8, UINT64_MAX, known - 16, known + 1, known + 16};
    for (int i = 0; i < 1000; i++) addresses.push_back(random() >> (i % 64));
    for (uint64_t address : addresses) EXPECT_FALSE(HeldSymbol(address, bird)) << address;

    auto symbol = std::make_unique<ScriptSymbolT<Bird>>();
    EXPECT_FALSE(MayCall(symbol.get(), bird)) << "on no record yet";
    symbol->Init(1, "Late", SST_Function, __ScriptInfo_Bird, {});
    symbol->Init(1, "Later", SST_Function, __ScriptInfo_Bird, {});
    EXPECT_TRUE(MayCall(symbol.get(), bird));
    ScriptSymbol* gone = symbol.get();
    symbol.reset();
    EXPECT_FALSE(MayCall(gone, bird));
}

TEST(LiveSymbols, AWithdrawnSymbolWaitsForItsCalls) {
    Bird bird;
    ScriptSymbolT<Bird> symbol(nullptr, "Passing", SST_Function, __ScriptInfo_Bird);
    {
        HeldSymbol call(reinterpret_cast<uint64_t>(&symbol), bird);
        EXPECT_TRUE(call);
        EXPECT_FALSE(symbol.Withdraw());
        EXPECT_EQ(__ScriptInfo_Bird.FindSymbol("Passing", 0), nullptr);
        EXPECT_FALSE(MayCall(&symbol, bird));
        EXPECT_EQ(call->GetInfo(), &__ScriptInfo_Bird) << "the call still sees all of it";
    }
    EXPECT_TRUE(symbol.Withdraw());
    symbol.Init(1, "Passing", SST_Function, __ScriptInfo_Bird, {});
    EXPECT_TRUE(MayCall(&symbol, bird));
}

// Thousands come and go, so that the table grows, while others look them up and call them.
TEST(LiveSymbols, ComeAndGoWhileOthersCall) {
    constexpr int kSymbols = 700;
    struct Symbol : ScriptSymbolT<Bird> {
        ~Symbol() override { m_IsAlive = false; }
        void DoCall(ScriptObject*, ScriptArgs&, bool) override { EXPECT_TRUE(m_IsAlive); }
        std::atomic<bool> m_IsAlive{true};
    };
    Bird bird;
    ScriptInfoT<Bird> info(1, "Flock", "", "");
    _InitScriptInfo(info, &__ScriptInfo_Bird);
    bird.SetScriptInfo(&info);
    std::atomic<uint64_t> addresses[kSymbols]{};
    std::atomic<bool> isOver{false};
    std::atomic<unsigned> calls{0};
    auto call = [&](unsigned seed) {
        std::mt19937 random(seed);
        ScriptArgs args;
        while (!isOver) {
            HeldSymbol symbol(addresses[random() % kSymbols], bird);
            if (!symbol) continue;
            symbol->Call(&bird, args, false);
            calls++;
        }
    };
    std::vector<std::thread> threads;
    for (unsigned t = 0; t < 3; t++) threads.emplace_back(call, t);
    for (int round = 0; round < 20 || calls < 1000; round++) {
        std::vector<std::unique_ptr<Symbol>> symbols(kSymbols);
        for (int i = 0; i < kSymbols; i++) {
            symbols[i] = std::make_unique<Symbol>();
            symbols[i]->Init(1, "Flap", SST_Function, info, {});
            addresses[i] = reinterpret_cast<uint64_t>(symbols[i].get());
        }
        for (auto& symbol : symbols) {
            while (!symbol->Withdraw()) std::this_thread::yield();
        }
    }
    isOver = true;
    for (std::thread& thread : threads) thread.join();
    for (auto& address : addresses) EXPECT_FALSE(HeldSymbol(address, bird));
}

#ifdef KORVEL_FAULTS
TEST(LiveSymbols, AreFoundWithoutMemoryForTheTable) {
    Bird bird;
    std::vector<ScriptSymbolT<Bird>> symbols(2000);
    for (auto& symbol : symbols) {
        Faults::FailAt(1, true);
        symbol.Init(1, "Flap", SST_Function, __ScriptInfo_Bird, {});
        Faults::Stop();
    }
    for (auto& symbol : symbols) EXPECT_TRUE(MayCall(&symbol, bird));
}
#endif

#ifndef NDEBUG
TEST(LockRankDeathTest, TheOrderIsAsserted) {
    static SpinLock s_Last, s_Other;
    static NestedSpinLock s_Nested;
    auto last = [] { AutoPlacedLock lock(LockRank::Last, s_Last); };
    auto exports = [] { AutoPlacedLock lock(LockRank::Exports, s_Other); };
    auto connection = [] { LockPlace place(LockRank::Connection); };
    {
        LockPlace outer(LockRank::Connection);
        connection();
        exports();
        EXPECT_DEATH(last(), "alone");
        AutoNestedSpinLock free(s_Nested);
    }
    last();
    {
        AutoPlacedLock lock(LockRank::Exports, s_Other);
        EXPECT_DEATH(exports(), "order");
        EXPECT_DEATH(connection(), "order");
        EXPECT_DEATH(last(), "alone");
        EXPECT_DEATH(s_Nested.ObtainLock(), "nothing");
    }
    {
        AutoPlacedLock lock(LockRank::Last, s_Last);
        EXPECT_DEATH(exports(), "order");
        EXPECT_DEATH(connection(), "order");
    }
}
#endif

}  // namespace

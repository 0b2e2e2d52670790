// Values at the limits: levels without end, host code that comes back, memory that runs out.
#include <gtest/gtest.h>
#include <pthread.h>

#include <cstring>
#include <list>
#include <memory>

#include "ScriptValFakes.h"
#include "core/FaultsInternal.h"
#include "core/ScriptVal.h"

namespace Korvel {
namespace {

using namespace Test;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr size_t kSmallStack = 1 << 20;  // the same calls need more under a sanitizer
#else
constexpr size_t kSmallStack = 128 << 10;
#endif

void OnSmallStack(const std::function<void()>& body) {
    pthread_attr_t attributes;
    pthread_attr_init(&attributes);
    pthread_attr_setstacksize(&attributes, kSmallStack);
    pthread_t thread;
    auto run = [](void* function) -> void* {
        (*static_cast<const std::function<void()>*>(function))();
        return nullptr;
    };
    void* function = const_cast<std::function<void()>*>(&body);
    ASSERT_EQ(pthread_create(&thread, &attributes, run, function), 0);
    pthread_join(thread, nullptr);
    pthread_attr_destroy(&attributes);
}

// A value that lies `levels` tables deep, in values ("v"), in keys ("k") or in both by turns.
ScriptVal MakeDeep(size_t levels, const char* where, ScriptVal innermost) {
    ScriptVal value = std::move(innermost);
    for (size_t i = 0; i < levels; i++) {
        const bool inKey = where[i % strlen(where)] == 'k';
        auto* entry = new TableEntry(inKey ? std::move(value) : ScriptVal("k"));
        entry->m_Value = inKey ? ScriptVal(1) : std::move(value);
        value = SV_Table;
        value.SetTable(entry);
    }
    return value;
}

TEST(ScriptValDeep, TheStackDoesNotLimitTheLevels) {
    constexpr size_t kLevels = 100'000;
    for (const char* where : {"v", "k", "vk"}) {
        OnSmallStack([where] {
            ScriptVal deep = MakeDeep(kLevels, where, "end"), copy(deep);
            const ScriptVal other = MakeDeep(kLevels, where, "END");
            EXPECT_TRUE(copy == deep && deep == copy && deep != other) << where;
            copy.SetFlagsRecurse(SVF_Ordered, SV_Table, true, true);
            copy.ClearFlagsRecurse(SVF_Ordered, SV_Table, true, true);
            copy += deep;
            EXPECT_TRUE(copy == deep && copy.m_Flags == SV_Table);
            copy -= other;
            EXPECT_TRUE(copy == deep);
            copy -= deep;
            EXPECT_TRUE(copy.IsNil());
            deep = std::move(deep.m_Value.m_Table.m_Table->m_Value);
        });
    }
    OnSmallStack([] {
        ScriptVal text = MakeTable({{1, "text"}});
        text.SetConstructor("__tr");
        text = MakeDeep(kLevels, "v", std::move(text));
        EXPECT_EQ(text.Translate(nullptr), 1);
        EXPECT_TRUE(text == MakeDeep(kLevels, "v", "text"));
    });
}

TEST(ScriptValDeep, DumpsTwoThousandLevels) {
    constexpr size_t kLevels = 2000;
    testing::internal::CaptureStdout();
    OnSmallStack([] { MakeDeep(kLevels, "v", 5).Dump(); });
    const std::string text = testing::internal::GetCapturedStdout();
    std::string expected;
    for (size_t i = 0; i < kLevels; i++) {
        expected += "Table\n" + std::string(2 * i, ' ') + "{\n";
        expected += std::string(2 * i + 2, ' ') + "\"k\" = ";
    }
    expected += "5\n";
    for (size_t i = kLevels; i-- > 0;) expected += std::string(2 * i, ' ') + "}\n";
    EXPECT_TRUE(text == expected) << text.size() << " bytes for " << expected.size();
}

TEST(ScriptValDeep, ReleasesValueBeforeKeyFromHeadToTail) {
    std::string events;
    std::list<FakeObject> objects;
    auto object = [&](char name) {
        return &objects.emplace_back([&events, name] { events += name; });
    };
    for (ScriptValType type : {SV_Table, SV_Args}) {
        ScriptVal table(type, nullptr);
        table[MakeTable({{object('F'), object('E')}, {"x", object('G')}})] =
            MakeTable({{object('B'), object('A')}, {object('D'), object('C')}});
        table["y"] = object('H');
        events.clear();
        table.CleanUp();
        EXPECT_EQ(events, "ABCDEFGH");
        for (const FakeObject& o : objects) EXPECT_EQ(o.m_Uses, 0);
    }
}

#ifdef KORVEL_FAULTS
// Lets each allocation of a scenario fail, alone and with all that follow. `run` does its work and
// returns the checks, which have memory at hand.
template <class Run>
void WithEachAllocationFailing(Run run) {
    unsigned count = 1;
    for (unsigned n = 1; n <= count; n++) {
        for (bool forGood : {true, false}) {
            SCOPED_TRACE(n);
            Faults::FailAt(n, forGood);
            auto check = run();
            const unsigned asked = Faults::Stop();
            if (!forGood) count = asked;
            check();
        }
    }
    EXPECT_GT(count, 50u);
}

TEST(ScriptValDeep, ACopyIsWholeOrNilWhereMemoryRunsOut) {
    FakeObject object;
    char bytes[] = "abc";
    const std::vector<double> numbers(70, 1.5);
    ScriptVal table = MakeTable({{"text", "value"}, {1, MemBlock(bytes, 3)}, {2, &object}});
    table["list"].TableFromArray(numbers.data(), 70);
    table[MakeTable({{"a", "b"}})] = MakeTable({{"c", MakeTable({{"d", ScriptVal(bytes, 2, 1)}})}});
    table.SetConstructor("name");
    const ScriptVal args(SV_Args, table.GetData());
    const std::string whole = Describe(table), wholeArgs = Describe(args);
    WithEachAllocationFailing([&] {
        struct Results {
            ScriptVal m_Copies[4], m_Args, m_Parts{SV_Table, nullptr};
        };
        auto results = std::make_shared<Results>();
        ScriptVal(&copies)[4] = results->m_Copies;
        copies[0] = table;
        copies[1] += table;
        copies[2] = ScriptVal(SV_Table, table.GetData());
        if (std::unique_ptr<TableEntry> entry{new TableEntry(table)}) copies[3] = entry->m_Key;
        results->m_Args = args;
        results->m_Parts += table;
        return [results, &table, &whole, &wholeArgs] {
            for (const ScriptVal& v : results->m_Copies) {
                EXPECT_EQ(Describe(v), v.IsNil() ? "0:nil" : whole);
            }
            EXPECT_EQ(Describe(results->m_Args), results->m_Args.IsNil() ? "0:nil" : wholeArgs);
            TableEntry* entry = nullptr;  // an entry that came has come whole
            while (results->m_Parts.NextKey(entry)) {
                EXPECT_EQ(Describe(entry->m_Value), Describe(table.FindKeyConst(entry->m_Key)));
            }
        };
    });
    table = SV_Nil;
    EXPECT_EQ(object.m_Uses, 1);  // by the args
}

TEST(ScriptValDeep, EveryOperationSurvivesAFailingAllocation) {
    FakeWire wire;
    wire.m_Reply.ReturnString("result");
    const double numbers[] = {1, 2, 3};
    ScriptVal translated = MakeTable({{1, "text"}, {2, "comment"}});
    translated.SetConstructor("__tr");
    const ScriptVal source = MakeTable({{"a", MakeTable({{"b", "c"}})}, {"t", translated}});
    WithEachAllocationFailing([&] {
        auto value = std::make_shared<ScriptVal>(source);
        ScriptVal& v = *value;
        v.Ensure(SV_Table);
        v["key"] = "text";
        v[1] = MakeTable({{"x", 1}});
        v.FindKey("counted text", 7) = ScriptVal("counted text", 7);
        if (ScriptVal* found = v.FindKeyNoCase("NEW")) *found = 5;
        if (ScriptVal* found = v.FindKeyNest("p.q.3", true)) *found = "deep";
        if (ScriptVal* found = v.FindKeyNoCaseNest("P.Q.R", true)) *found = "deep";
        v.AddKey("added") = OxID("id", true);
        v.SetKey("set", v);
        v.GetKey("got");
        v.SetConstructor("name");
        v.SetError(SCERR_InvalidIndex);
        v.SetError(static_cast<ScriptError>(77));
        v["list"].TableFromArray(numbers, 3);
        v["id"] = ScriptVal::CreateUUID();
        v["own"].From(std::string("own"));
        v += source;
        v["set"] -= source;
        v["set"] = v["a"];
        v.Translate("domain");
        OxStringT<char> text = v["key"].ToOxStringA("d");
        std::string plain;
        v["key"].To(plain);
        ScriptArgs args;
        args.SetArguments(1, "two", v);
        args.SetApp(wire.App(0));
        args.m_Value.m_Args.m_Context = 7;
        for (int i = 0; i < 3; i++) args.ReturnString("result");
        if (std::unique_ptr<ScriptArgs> later{args.DeferReply()}) later->SendReply();
        ScriptVal proxy = wire.ProxyValue(0);
        v["called"] = proxy.CallMember("Run", 1, "two", v);
        v["read"] = proxy.GetKey("key");
        proxy.SetKey("key", v);
        wire.m_Sent = SV_Nil;
        return [value] {
            ScriptVal copy(*value);
            EXPECT_EQ(Describe(copy), Describe(*value));
            copy["new"] = "entry";
            EXPECT_TRUE(!copy.IsTable() || copy["new"] == "entry");
        };
    });
    EXPECT_EQ(wire.m_Uses[wire.App(0)] + wire.m_Uses[wire.Proxy(0)], 0);
}
#endif

}  // namespace
}  // namespace Korvel

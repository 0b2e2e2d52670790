// Values while others hold parts of them: arguments that lie inside of the value that changes, and
// host code that comes back to it.
#include <gtest/gtest.h>

#include <thread>

#include "ScriptValFakes.h"
#include "core/FaultsInternal.h"

namespace Korvel::Test {
namespace {

// What an object does when it is released may reach the value that is being changed.
TEST(ScriptValHostCode, MayComeBackWhileAValueChanges) {
    using Step = void (*)(ScriptVal&);
    const Step visits[] = {
        [](ScriptVal& t) { t.CleanUp(); },
        [](ScriptVal& t) { t = 5; },
        [](ScriptVal& t) { t.Set(SV_Args, nullptr); },
        [](ScriptVal& t) { t.SetKey("new", MakeTable()); },
        [](ScriptVal& t) { ScriptVal copy(t), moved(std::move(t)); },
        [](ScriptVal& t) { EXPECT_FALSE(Describe(t).empty()); },
    };
    const Step changes[] = {
        [](ScriptVal& t) { t.CleanUp(); },
        [](ScriptVal& t) { t = "other"; },
        [](ScriptVal& t) { t.Set(SV_Args, nullptr); },
        [](ScriptVal& t) { t = std::move(t["inner"]); },
        [](ScriptVal& t) { t["inner"] = SV_Nil; },
        [](ScriptVal& t) { t -= ScriptVal(t); },
        [](ScriptVal& t) {
            static FakeObject s_Other;
            t += MakeTable({{1, &s_Other}, {"inner", MakeTable({{"x", &s_Other}})}});
        },
        [](ScriptVal& t) { t.Translate("domain"); },
        [](ScriptVal& t) { t.FindKeyNest("1.a.b.c", true); },
    };
    for (const Step& visit : visits) {
        for (const Step& change : changes) {
            ScriptVal table(SV_Table, nullptr);
            bool isArmed = false;  // not for the copies that are made on the way in
            int visitCount = 0;
            auto come = [&] {
                if (!isArmed) return;
                visitCount++;
                visit(table);
            };
            FakeObject first(come), second(come);
            table[1] = &first;
            table["inner"] = MakeTable({{"x", &second}, {&second, &first}});
            table["text"] = MakeTable({{1, "text"}, {2, &second}});
            table["text"].SetConstructor("__tr");
            ASSERT_EQ(table.NumKeys(), 3u);
            isArmed = true;
            change(table);
            isArmed = false;
            while (!table.IsNil()) table.CleanUp();
            EXPECT_TRUE(first.m_Uses == 0 && second.m_Uses == 0)
                << &visit - visits << " " << &change - changes;
            EXPECT_GT(visitCount, 0) << &change - changes;
        }
    }
}

TEST(ScriptValHostCode, MayGiveAnArgsListAnotherConnectionWhileItIsCleaned) {
    FakeWire wire;
    ScriptArgs args;
    FakeObject object([&] {
        args.Ensure(SV_Args);
        args.SetApp(wire.App(1));
    });
    args.SetApp(wire.App(0));
    args.Return(ScriptVal(&object));
    args.CleanUp();
    EXPECT_TRUE(wire.m_Uses[wire.App(0)] == 0 && wire.m_Uses[wire.App(1)] == 1);
    args.CleanUp();
    EXPECT_EQ(wire.m_Uses[wire.App(1)], 0);
}

// Each call is given a text or value that it replaces on its way.
TEST(ScriptValHostCode, ArgumentsMayLieInWhatIsReplaced) {
    ScriptVal t = MakeTable({{"a", "a.b.xxx.y"}});
    ScriptVal* made = t.FindKeyNest(t["a"], true);
    EXPECT_TRUE(made && made == t.FindKeyNestConst("a.b.xxx.y"));

    t = MakeTable({{"Error", "what went wrong"}});
    t.SetError(SCERR_Unknown, t["Error"].ToString());
    EXPECT_TRUE(t["Error"] == 1 && t["ErrorString"] == "what went wrong");

    ScriptArgs args;
    args.SetArguments("one", "two");
    EXPECT_TRUE(args.SetArguments(args[2], args[1]));
    EXPECT_TRUE(args[1] == "two" && args[2] == "one");

    // A look-up that fails gives the thread's own nil; what is written there is an argument, too.
    ScriptVal number(5);
    ScriptVal& lost = number["none"];
    lost = MakeTable({{"p", "kept"}});
    ScriptArgs call;
    EXPECT_TRUE(call.SetArguments(lost["p"]) && call[1] == "kept");
    std::thread([] { EXPECT_TRUE(ScriptVal(1)["none"].IsNil()); }).join();
    EXPECT_TRUE(lost["p"] == "kept");  // another thread has another one
}

TEST(ScriptValHostCode, ReadOnlyPartsStayAsTheyAre) {
    auto readOnly = [](ScriptVal value) {
        value.m_Flags |= SVF_ReadOnly;
        return value;
    };
    ScriptVal nested(SV_Table, nullptr);
    nested["in"] = readOnly(MakeTable({{"x", 1}}));
    nested -= ScriptVal(nested);
    EXPECT_EQ(Shape(nested), "{'in'={'x'=1}}");
    ScriptVal moved(readOnly(MakeTable({{"Error", 1}})));
    moved -= ScriptVal(moved);
    moved.SetError(SCERR_InvalidIndex);
    moved.SetKey("Error", 7);
    EXPECT_EQ(Shape(moved), "{'Error'=1}");

    ScriptVal text = MakeTable({{1, "text"}});
    text.SetConstructor("__tr");
    text.m_Flags |= SVF_ReadOnly;
    EXPECT_TRUE(text.Translate(nullptr) == 1 && text.IsTable());

    ScriptVal::TablePayload payload{};
    char plain[] = "name";
    payload.m_Constructor = plain;
    ScriptVal made(SV_Table | SVF_ReadOnly, &payload);
    plain[0] = 'g';
    EXPECT_STREQ(made.GetConstructor(), "name");  // a text of its own
    EXPECT_EQ(made.m_Flags, SV_Table | SVF_ReadOnly);
}

TEST(ScriptValHostCode, CountedKeysEndWithTheirText) {
    ScriptVal table(SV_Table, nullptr);
    table.FindKey(nullptr, 100) = 1;
    table.FindKey("ab", 100) = 2;
    *table.FindKeyNoCase("AB", 1) = 3;
    EXPECT_EQ(Shape(table), "{''=1 'ab'=2 'A'=3}");
}

#ifdef KORVEL_FAULTS
TEST(ScriptValHostCode, CleaningUpNeverAllocates) {
    ScriptVal table = MakeTable({{"a", MakeTable({{MakeTable({{1, 2}}), "b"}})}, {3, "c"}});
    Faults::FailAt(1, true);
    table.CleanUp();
    EXPECT_EQ(Faults::Stop(), 0u);
}
#endif

}  // namespace
}  // namespace Korvel::Test

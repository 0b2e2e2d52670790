#include "core/ScriptVal.h"

#include <gtest/gtest.h>

#include <climits>
#include <cstring>
#include <limits>
#include <thread>
#include <type_traits>

#include "ScriptValFakes.h"
#include "core/TextCellInternal.h"

namespace Korvel {
namespace {

using namespace Test;

constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();
constexpr double kInf = std::numeric_limits<double>::infinity();
constexpr double k31 = 2147483648.0, k32 = 4294967296.0, k63 = 9223372036854775808.0;

// What a value is made from, assigned or told by From comes back by To.
template <class T>
void ExpectFlags(T source, uint32_t flags) {
    ScriptVal assigned("old");
    assigned = source;
    EXPECT_EQ(ScriptVal(source).m_Flags, flags);
    EXPECT_EQ(Describe(ScriptVal(source)), Describe(assigned));
}
template <class T>
void ExpectFrom(T source, uint32_t flags) {
    ScriptVal value("old");
    T back{};
    EXPECT_TRUE(!MakeTable().To(back) && back == T{});
    EXPECT_TRUE(value.From(source, "unused") && value.To(back, "unused"));
    EXPECT_TRUE(value.m_Flags == flags && back == source);
}

TEST(ScriptVal, FlagsTellWhatItCameFrom) {
    ExpectFlags(1.5, 1);
    ExpectFlags(1.5f, 0x100001);
    ExpectFlags(-7, 0x300001);
    ExpectFlags(7u, 0x200001);
    ExpectFlags(-7ll, 0x200001);
    ExpectFlags(7ull, 0x200001);
    ExpectFlags(7ul, 0x200001);
    ExpectFlags(true, 3);
    ExpectFlags(OxID("text"), 2);
    ExpectFlags(MemBlock(), 9);
    ExpectFlags(static_cast<ScriptObject*>(nullptr), 0x100000);
    ExpectFlags(static_cast<const char*>(nullptr), 0);

    ExpectFrom(1.5, 1);
    ExpectFrom(1.5f, 0x100001);
    ExpectFrom(-7, 0x300001);
    ExpectFrom(-7ll, 0x200001);
    ExpectFrom(1ull << 63, 0x200001);
    ExpectFrom(true, 3);
    ExpectFrom(static_cast<void*>(stdout), 12);
    ExpectFrom(std::string("text"), 2);

    static_assert(!std::is_constructible_v<ScriptVal, int*>);  // no pointer becomes a boolean
    static_assert(!std::is_constructible_v<ScriptVal, ScriptValType>);
}

TEST(ScriptVal, SetReadsThePayloadOfItsType) {
    char bytes[] = "abcd";
    const double number = 2.5;
    const uint64_t address = 0x1234;
    const char *const text = "text", *const noText = nullptr;
    void* const none = nullptr;
    const OxID id("text");
    const MemBlock block(bytes, 4), zeros(nullptr, 2);
    const ScriptVal::BlockPayload code{bytes, 3, 5};
    const ScriptVal table = MakeTable({{1, 2}});
    struct Case {
        ScriptValType type;
        const void* data;
        const char* expected;
    };
    const Case cases[] = {
        {SV_Nil, nullptr, "0:nil"},
        {SV_Nil | SVF_KeptNil, bytes, "100000:nil"},
        {SV_Number | SVF_Int, &number, "300001:2.5"},
        {SV_String, &text, "2:'text'"},
        {SV_String, &id, "2:'text'"},
        {SV_String | 0x400000u, &noText, "0:nil"},
        {SV_Boolean, "\1", "3:true"},
        {SV_Table | SVF_List, &table.m_Value, "400004:{300001:1=300001:2}"},
        {SV_Function, &address, "5:1234"},
        {SV_Pointer, &address, "c:1234"},
        {SV_RemoteObject, &none, "100000:nil"},
        {SV_LocalObject, &none, "100000:nil"},
        {SV_Code, &code, "8:[abc]"},
        {SV_MemBlock, &block, "9:[abcd]"},
        {SV_Args, nullptr, "a:{}"},
        {SV_Ref, bytes, "0:nil"},
        {ScriptValType(13 | SVF_ReadOnly), bytes, "0:nil"},
    };
    for (const Case& c : cases) {
        ScriptVal value("old");
        value.Set(c.type, c.data);
        EXPECT_EQ(Describe(value), c.expected) << &c - cases;
        EXPECT_EQ(Describe(ScriptVal(value)), c.expected);
    }
    for (ScriptValType type : {SV_Function, SV_Pointer, SV_RemoteObject, SV_MemBlock}) {
        EXPECT_FALSE(Describe(ScriptVal(type, nullptr)).empty());  // not allowed, and harmless
    }
    const ScriptVal zeroed(zeros), coded(bytes, 4, 9);
    EXPECT_TRUE(!memcmp(zeroed.ToMemBlock().m_Ptr, "\0", 2) && zeroed.ToMemBlock().m_Size == 2);
    EXPECT_TRUE(coded.ToCodeLen() == 4 && coded.ToCodeArgs() == 9 && coded.ToCodePtr() != bytes);
    double got = 0;
    EXPECT_FALSE(ScriptVal("2.5").Get(SV_Number, &got) || table.Get(SV_Table, &got));
}

TEST(ScriptVal, SetReturnsBeforeItTouchesAnything) {
    FakeWire wire;
    ScriptVal proxy = wire.ProxyValue(0);
    RemoteObject* same = wire.Proxy(0);
    int traffic = wire.m_Traffic;
    proxy.Set(SV_RemoteObject | 0x100u, &same);  // the same proxy: not even its flags
    EXPECT_TRUE(proxy.m_Flags == SV_RemoteObject && wire.m_Traffic == traffic);
    ScriptVal number(5);
    number.Set(SV_Boolean, &number.m_Value);  // the own payload, as whatever type
    number.Set(SV_Nil, &number.m_Value);
    EXPECT_EQ(Describe(number), "300001:5");
    number.Set(SV_Number | SVF_ReadOnly, nullptr);
    number.Set(SV_Boolean, nullptr);
    EXPECT_EQ(Describe(number), "201:0");
}

TEST(ScriptVal, NumbersConvertForEveryDouble) {
    struct Case {
        double number;
        long long integer;
        int narrow;
        uint32_t color;
    };
    const Case cases[] = {
        {kNaN, 0, 0, 0},
        {3.99, 3, 3, 3},
        {k31, 1ll << 31, INT_MIN, 0x80000000},
        {k32 - 1, (1ll << 32) - 1, -1, 0xFFFFFFFF},
        {k32 + 5, (1ll << 32) + 5, INT_MAX, 5},
        {-k31, INT_MIN, INT_MIN, 0x80000000},
        {-k31 - 1, INT_MIN - 1ll, INT_MIN, 0x7FFFFFFF},
        {k63, LLONG_MAX, INT_MAX, 0xFFFFFFFF},
        {-k63, LLONG_MIN, INT_MIN, 0},
        {kInf, LLONG_MAX, INT_MAX, 0xFFFFFFFF},
        {-kInf, LLONG_MIN, INT_MIN, 0},
    };
    for (const Case& c : cases) {
        const ScriptVal value(c.number);
        int narrow = 1;
        long long wide = 1;
        EXPECT_EQ(value.ToInteger(1), c.integer) << c.number;
        EXPECT_TRUE(value.To(narrow) && value.To(wide) && wide == c.integer);
        EXPECT_EQ(narrow, c.narrow) << c.number;
        EXPECT_EQ(value.ToColor(1), c.color) << c.number;
    }
    EXPECT_EQ(ScriptVal().ToInteger((1ll << 53) + 1), 1ll << 53);  // defaults are doubles, too
}

TEST(ScriptVal, WrongTypesAndNullGiveTheDefault) {
    const ScriptVal* volatile none = nullptr;
    const ScriptVal nil, number(1), text("1"), yes(true);
    char place;
    auto* proxy = reinterpret_cast<RemoteObject*>(&place);
    for (const ScriptVal* v : {static_cast<const ScriptVal*>(none), &nil, &number, &text, &yes}) {
        EXPECT_EQ(v->ToNumber(7), v == &number ? 1 : 7);
        EXPECT_EQ(v->ToInteger(7), v == &number ? 1 : 7);
        EXPECT_EQ(v->ToBoolean(false), v == &yes);
        EXPECT_STREQ(v->ToString("d"), v == &text ? "1" : "d");
        EXPECT_TRUE(v->ToOxStringA("d") == (v == &text ? "1" : "d"));
        EXPECT_TRUE(v->ToFunction(7) == 7 && v->ToPointer(&place) == &place &&
                    v->ToRemoteObject(proxy) == proxy && v->ToLocalObject() == nullptr);
        EXPECT_TRUE(!v->ToMemBlock().m_Ptr && !v->ToCodePtr() && !v->ToCodeLen());
        EXPECT_TRUE(v->IsEmpty() && !v->IsTable() && !v->IsLocalObject(false));
        EXPECT_EQ(v->KeepMe(), v != none && v != &nil);
    }
}

TEST(ScriptVal, CountedTextsHoldAnyBytes) {
    struct Case {
        const char* bytes;
        int length;
        std::string text;
    };
    const Case cases[] = {
        {"abc", 2, "ab"}, {"abc", 0, ""},     {"abc", -3, ""},
        {"a\0b", 3, "a"}, {"\xFFy", 2, "?y"}, {"x\xFF", 2, "x\xFF"},
    };
    for (const Case& c : cases) {
        const ScriptVal value(c.bytes, c.length), copy(value), table = MakeTable({{value, 1}});
        EXPECT_EQ(value.ToString(""), c.text);
        EXPECT_TRUE(copy == value && value == copy && value == c.text.c_str());
        EXPECT_EQ(copy.m_Value.m_String.m_String, value.m_Value.m_String.m_String);  // shared
        EXPECT_TRUE(table[copy] == 1 && table[c.text.c_str()] == 1);
    }
    EXPECT_EQ(ScriptVal("a\0b", 3).ToString()[2], 'b');
    const char* const null = nullptr;
    ScriptVal value("old");
    value.Set(SV_String, &null, 3);
    EXPECT_EQ(Describe(value), "0:nil");
    value.From(std::string("\xFFx"));  // never taken for a cell
    EXPECT_STREQ(value.ToString(), "?x");
    OxID cell("shared", true);
    value = cell;
    EXPECT_EQ(TextCell::Count(ScriptVal(value).m_Value.m_String.m_String), 3u);
    EXPECT_EQ(value.m_Value.m_String.m_Hash, GetHashValue("SHARED"));
}

TEST(ScriptVal, ReadOnlyKeepsItsValueUnlessMoved) {
    auto change = [](ScriptVal& v) {
        v = 1, v = 1.5, v = true, v = "other", v = OxID("other"), v = MemBlock();
        v = static_cast<ScriptObject*>(nullptr), v = SV_Table, v = ScriptVal::nil;
        v.Ensure(SV_Boolean), v.Set(SV_String, nullptr), v.From(1), v.From(std::string("x"));
        v -= ScriptVal(5), v += ScriptVal("other"), v += MakeTable({{2, 1}});
        v["other"] = v[-1] = v[ScriptVal(true)] = 1;
        v.SetKey("other", 1), v.GetKey(7), v.AddKey("other") = 1;
        v.FindKeyNest("other.key", true), v.FindKeyNoCaseNest("other", false);
        v.SetConstructor("other"), v.SetError(SCERR_Unknown), ScriptVal::CreateUUID(v);
        v.TableFromArray<double>(nullptr, 0);
        EXPECT_EQ(v.TakeTable(), nullptr);
    };
    for (const ScriptVal& start : {ScriptVal(5), ScriptVal("text"), MakeTable({{"key", 1}})}) {
        ScriptVal value(start);
        value.SetFlagsRecurse(SVF_ReadOnly, value.Type(), false, false);
        const std::string before = Describe(value);
        change(value);
        EXPECT_EQ(Describe(value), before);
        EXPECT_EQ(Describe(ScriptVal(value)), Describe(start));  // a copy can be written
        ScriptVal target(7);
        target.SetFlagsRecurse(SVF_ReadOnly, SV_Number, false, false);
        target = std::move(value);
        EXPECT_TRUE(Describe(target) == before && value.m_Flags == 0);  // NOLINT: the rule
        target.CleanUp();
        EXPECT_EQ(target.m_Flags, 0u);
    }
    const_cast<ScriptVal&>(ScriptVal::nil) = 5;
    EXPECT_EQ(Describe(ScriptVal::nil), "200:nil");
    EXPECT_EQ(Describe(ScriptVal(ScriptVal::nil)), "0:nil");
}

TEST(ScriptVal, NoticesThatItsObjectHasDied) {
    FakeObject other, alive;
    alignas(FakeObject) char place[sizeof(FakeObject)];
    auto* object = new (place) FakeObject;
    ScriptVal value(object), copy(value), second(&alive);
    EXPECT_TRUE(object->m_Uses == 2 && value == copy && value != second);
    EXPECT_TRUE(value.IsLocalObject(true) && value.GetData() == &value.m_Value);
    {
        ScriptVal foreign(SV_LocalObject | SVF_Foreign, &object), copied(foreign);
        EXPECT_TRUE(foreign.ToLocalObject() == object && copied == foreign);
    }
    EXPECT_EQ(object->m_Uses, 2);  // a foreign one neither adds nor gives back
    object->~FakeObject();
    auto* reborn = new (place) FakeObject;
    ScriptVal fresh(reborn);
    ScriptObject* out = &other;
    EXPECT_TRUE(value.ToLocalObject(&other) == nullptr && value.GetData() == nullptr);
    EXPECT_TRUE(value.Get(SV_LocalObject, &out) && out == nullptr);
    EXPECT_TRUE(value == copy && value != fresh && value != ScriptVal() && value != second);
    EXPECT_EQ(fresh.ToLocalObject(), reborn);
    for (const ScriptVal& dead : {ScriptVal(value), MakeTable({{1, value}})[1]}) {
        EXPECT_TRUE(dead.m_Flags == SVF_KeptNil && dead.KeepMe() && dead.IsNil());
    }
    EXPECT_TRUE(value.CallMember("any").IsNil());
    value = copy = SV_Nil;
    EXPECT_EQ(reborn->m_Uses, 1);
    reborn->~FakeObject();
}

TEST(ScriptVal, EqualityIsByContent) {
    FakeWire wire;
    FakeObject object, other;
    char bytes[] = "abc";
    const uint64_t place = 1;
    const ScriptVal nil, function(SV_Function, &place), args(SV_Args, nullptr);
    const ScriptVal kept(SV_Nil | SVF_KeptNil, nullptr), odd = MakeTable({{1, function}});
    const ScriptVal inner = MakeTable({{1, 2}}), differs = MakeTable({{1, 3}});
    using Pair = std::pair<ScriptVal, ScriptVal>;
    const Pair equal[] = {
        {nil, kept},
        {1, 1.0f},
        {&object, &object},
        {wire.ProxyValue(2), wire.ProxyValue(3)},
        {MemBlock(bytes, 3), MemBlock(bytes, 3)},
        {MakeTable({{1, 2}, {"a", 3}}), MakeTable({{"a", 3}, {1, 2}})},
        {inner, MakeTable({{1, 2}, {2, nil}, {nil, 5}})},
        {MakeTable({{inner, 3}, {"k", inner}}), MakeTable({{inner, 3}, {"k", inner}})},
    };
    const Pair different[] = {
        {1, "1"},
        {1, true},
        {kNaN, kNaN},
        {"a", "A"},  // though their hashes are the same
        {args, args},
        {function, function},
        {&object, &other},
        {wire.ProxyValue(1), wire.ProxyValue(2)},
        {MemBlock(bytes, 3), MemBlock(bytes, 2)},
        {MemBlock(bytes, 2), MemBlock(bytes + 1, 2)},
        {inner, differs},
        {inner, MakeTable({{1, 2}, {2, 2}})},
        {inner, MakeTable({{1, 2}, {2, kept}})},           // a kept nil is counted
        {MakeTable({{2, kept}}), MakeTable({{2, kept}})},  // but never found
        {MakeTable({{kNaN, 1}}), MakeTable({{kNaN, 1}})},
    };
    for (const auto& [a, b] : equal) EXPECT_TRUE(a == b && b == a && !(a != b)) << Describe(a);
    for (const auto& [a, b] : different) EXPECT_TRUE(a != b && b != a && !(a == b)) << Describe(a);
    EXPECT_FALSE(function == function || args == args || odd == odd);  // NOLINT: not to itself
    ScriptVal named(inner);
    named.SetConstructor("name");
    named.SetFlagsRecurse(SVF_Ordered, SV_Table, false, false);
    EXPECT_TRUE(named == inner);
    const ScriptVal five(5), text("text");
    EXPECT_TRUE(five == 5 && five != 5.5 && five != "5" && text == OxID("text") && text != "Text" &&
                text != static_cast<const char*>(nullptr));
}

// Every argument may lie in the value that it changes: the outcome is that with a copy of it.
TEST(ScriptVal, ArgumentsMayBePartsOfTheValue) {
    using Part = const ScriptVal&;
    using Operation = void (*)(ScriptVal&, Part);
    const Operation operations[] = {
        [](ScriptVal& v, Part part) { v = part; },
        [](ScriptVal& v, Part part) { v += part; },
        [](ScriptVal& v, Part part) { v -= part; },
        [](ScriptVal& v, Part part) { v.Set(SV_Table, &part.m_Value); },
        [](ScriptVal& v, Part part) { v["a"] = part; },
        [](ScriptVal& v, Part part) { v.AddKey(part) = 1; },
        [](ScriptVal& v, Part part) { v.FindKey(part); },
    };
    using Path = Part (*)(Part);
    const Path paths[] = {
        [](Part v) -> Part { return v; },
        [](Part v) -> Part { return v["a"]; },
        [](Part v) -> Part { return v["a"]["a"]; },
    };
    const ScriptVal leaf = MakeTable({{"a", "x"}, {"b", 1}});
    for (const ScriptVal& start : {MakeTable({{"a", leaf}, {"b", 1}}), leaf,
                                   MakeTable({{"a", MakeTable({{"a", leaf}, {leaf, 7}})}}),
                                   MakeTable({{"b", 2}, {"a", MakeTable({{"b", 2}})}})}) {
        for (const Operation& operation : operations) {
            for (const Path& path : paths) {
                const bool needsTable = &operation - operations == 3;
                if (needsTable && !path(start).IsTable()) continue;
                ScriptVal expected(start), actual(start);
                const ScriptVal part(path(start));
                operation(expected, part);
                operation(actual, path(actual));
                const bool isOwn = needsTable && path == paths[0];  // left alone, flags too
                EXPECT_EQ(Describe(actual), Describe(isOwn ? start : expected))
                    << &operation - operations << " " << &path - paths;
            }
        }
    }
}

TEST(ScriptVal, ArgumentsMayPointIntoTheValue) {
    ScriptVal text("text");
    text = text.ToString("");
    const char* middle = text.ToString() + 1;
    text = middle;
    middle = text.ToString() + 1;
    text.Set(SV_String, &middle, 1);
    text = text;             // NOLINT: the rule under test
    text = std::move(text);  // NOLINT: the rule under test
    EXPECT_EQ(Describe(text), "2:'x'");

    const double doubles[] = {1.5, 2.5};
    ScriptVal block(MemBlock(const_cast<double*>(doubles), sizeof(doubles)));
    block = block.ToMemBlock();
    block.TableFromArray(static_cast<const double*>(block.ToMemBlock().m_Ptr), 2);
    EXPECT_EQ(Shape(block), "{1=1.5 2=2.5}");
    ScriptVal code("abc", 3u, 0);
    const ScriptVal::BlockPayload payload{static_cast<char*>(code.m_Value.m_Code.m_Ptr) + 1, 2, 1};
    code.Set(SV_Code, &payload);
    EXPECT_EQ(Shape(code), "[bc]");

    ScriptVal table = MakeTable({{"name", "new"}, {"p", "p.x"}});
    table.SetConstructor(table["name"].ToString());
    table.SetConstructor(table.GetConstructor());
    table.SetError(SCERR_Unknown, table["name"].ToString());
    table.SetError(SCERR_InvalidArgs, table["ErrorString"].ToString());
    *table.FindKeyNest(table["p"], true) = 5;  // the path is replaced while it is walked
    EXPECT_EQ(Shape(table), "new{'name'='new' 'p'={'x'=5} 'Error'=2 'ErrorString'='new'}");
    ScriptVal moved = MakeTable({{"a", MakeTable({{"b", "c"}})}});
    moved = std::move(moved["a"]);
    EXPECT_EQ(Shape(moved), "{'b'='c'}");
}

TEST(ScriptVal, DumpsItsText) {
    FakeWire wire;
    FakeObject object;
    uint64_t address = 0x123456789;
    char proxy[40];
    snprintf(proxy, sizeof(proxy), "Object: %p", static_cast<void*>(wire.Proxy(0)));
    const ScriptVal inner = MakeTable({{1, true}});
    struct Case {
        ScriptVal value;
        std::string text;
    };
    const Case cases[] = {
        {ScriptVal(SV_Nil | SVF_KeptNil, nullptr), "nil"},
        {1.0 / 3, "0.333333333333333"},
        {1.0f / 3, "0.333333"},
        {1ull << 40, "1099511627776"},
        {"te\"xt", "\"te\"xt\""},
        {ScriptVal(SV_Function, &address), "Function: 0000000123456789"},
        {ScriptVal(SV_Pointer, &address), "Pointer: 0000000123456789"},
        {wire.ProxyValue(0), proxy},
        {ScriptVal("abc", 3u, 0), "[Code]"},
        {MemBlock(&address, 8), "MemBlock (8 bytes)"},
        {&object, "???"},
        {ScriptVal(SV_Args, inner.GetData()), "Table\n  {\n    1 = true\n  }"},
        {MakeTable({{"k", ScriptVal()}, {inner, inner}}),
         "Table\n  {\n    \"k\" = nil\n    [Table] = Table\n    {\n      1 = true\n    }\n  }"},
    };
    for (const Case& c : cases) {
        testing::internal::CaptureStdout();
        c.value.Dump(1, false);
        c.value.Dump(1);
        EXPECT_EQ(testing::internal::GetCapturedStdout(), c.text + c.text + "\n");
    }
}

TEST(ScriptVal, ColorsArePackedWithoutClamping) {
    auto color = [](std::initializer_list<std::pair<ScriptVal, ScriptVal>> parts) {
        return MakeTable(parts).ToColor(7);
    };
    EXPECT_EQ(color({{"R", 1}, {"G", 0.5}, {"B", 0.1}, {"A", 0}}), 0x00197FFFu);
    EXPECT_EQ(color({{"R", 2}, {"r", 1}, {"G", "1"}, {"A", "0"}}), 0xFF0001FEu);
    EXPECT_EQ(color({{"R", -1}, {"A", kNaN}}), 0xFFFFFF01u);
    EXPECT_EQ(ScriptVal(SV_Args, nullptr).ToColor(7), 7u);
}

TEST(ScriptVal, ThreadsShareItsTexts) {
    const ScriptVal shared = MakeTable({{"key", "text"}, {1, MakeTable({{"key", "inner"}})}});
    const char* cell = shared["key"].m_Value.m_String.m_String;
    std::vector<std::thread> threads;
    for (int i = 0; i < 16; i++) {
        threads.emplace_back([&shared, handed = shared]() mutable {
            for (int k = 0; k < 500; k++) {
                ScriptVal copy(shared), text(shared["key"]), last(std::move(copy[1]));
                handed["key"] = text;
                handed[1] = last;
                text = handed["key"].ToString();
            }
        });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(TextCell::Count(cell), 1u);
    EXPECT_EQ(Shape(shared), "{'key'='text' 1={'key'='inner'}}");
}

}  // namespace
}  // namespace Korvel

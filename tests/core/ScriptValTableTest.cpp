#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <limits>
#include <random>

#include "ScriptValFakes.h"
#include "core/ScriptVal.h"

namespace Korvel {
namespace {

using namespace Test;

constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();

const TableEntry* Head(const ScriptVal& table) {
    return table.m_Value.m_Table.m_Table;
}

// The keys in the order of the chain, whose tail has to be where the table says.
std::string Order(const ScriptVal& table) {
    std::string order;
    const TableEntry* last = nullptr;
    for (const TableEntry* e = Head(table); e; e = e->m_Next) {
        order += (last ? " " : "") + Shape(e->m_Key);
        last = e;
    }
    EXPECT_TRUE(!table.IsTable() || table.m_Value.m_Table.m_Last == last);
    return order;
}

// A table made of entries with these keys, in this order; each value is the key's position.
ScriptVal Chain(const std::vector<ScriptVal>& keys) {
    TableEntry* head = nullptr;
    TableEntry** link = &head;
    for (const ScriptVal& key : keys) {
        *link = new TableEntry(key);
        (*link)->m_Value = static_cast<double>(&key - keys.data());
        link = &(*link)->m_Next;
    }
    ScriptVal table(SV_Table, nullptr);
    table.SetTable(head);
    return table;
}

// A table as a plain list, by the rule for new keys.
struct Model {
    using Entry = std::pair<ScriptVal, double>;

    const Entry* Find(const ScriptVal& key, bool noCase) const {
        for (const Entry& e : m_Entries) {
            if (e.first == key) return &e;
            const char* text = noCase ? e.first.ToString() : nullptr;
            if (text && key.IsString() && !strcasecmp(text, key.ToString())) return &e;
        }
        return nullptr;
    }
    void Put(const ScriptVal& key, double value, bool noCase = false) {
        if (const Entry* found = Find(key, noCase)) {
            const_cast<Entry*>(found)->second = value;
            return;
        }
        auto isGreater = [&](const Entry& e) {
            return key.IsNumber() && e.first.IsNumber() && e.first.ToNumber() > key.ToNumber();
        };
        m_Entries.insert(std::find_if(m_Entries.begin(), m_Entries.end(), isGreater), {key, value});
    }
    std::string Shape() const {
        std::string text;
        for (const Entry& e : m_Entries) {
            text += " " + Test::Shape(e.first) + "=" + Test::Shape(e.second);
        }
        return "{" + (text.empty() ? text : text.substr(1)) + "}";
    }

    std::vector<Entry> m_Entries;
};

TEST(ScriptValTable, AgreesWithAModelOfItsOrder) {
    std::mt19937 random(20240601);
    auto below = [&](unsigned n) { return static_cast<int>(random() % n); };
    auto anyKey = [&]() -> ScriptVal {
        static const char* const texts[] = {"a", "A", "ab", "Ab", "b", "B", "", "1"};
        if (below(2)) return texts[below(8)];
        return below(20) ? below(40) / 2.0 - 6 : kNaN;
    };
    ScriptVal table;
    Model model;
    for (int step = 0, next = 0; step < 24'000; step++) {
        if (step % 60 == 0) {
            table = step % 240 ? SV_Table : SV_Args;
            model = {};
            next = below(3) ? 30 : 0;  // some begin with a list
        }
        const ScriptVal key = next < 30 ? ScriptVal(next++) : anyKey();
        const std::string text = key.ToString("");
        const double value = step;
        switch (below(8)) {
            case 0:
                table.FindKey(key) = value;
                model.Put(key, value);
                break;
            case 1:
            case 2:
                (key.IsString() ? table[text.c_str()] : table[key.ToNumber()]) = value;
                model.Put(key, value);
                break;
            case 3:
                table.FindKey((text + "rest").c_str(), static_cast<int>(text.size())) = value;
                model.Put(text.c_str(), value);
                break;
            case 4:
                *table.FindKeyNoCase(text.c_str()) = value;
                model.Put(text.c_str(), value, true);
                break;
            case 5:
                table.AddKey(key) = value;
                if (table.IsTable() && key.IsString()) {
                    model.m_Entries.emplace_back(key, value);
                } else {
                    model.Put(key, value);
                }
                break;
            case 6:
                table = ScriptVal(table);
                if (TableEntry* chain = table.TakeTable()) table.SetTable(chain);
                break;
            default: {
                const Model::Entry* found = model.Find(key, false);
                const double wanted = found ? found->second : -1;
                ASSERT_EQ(table.Exists(key), found != nullptr);
                ASSERT_EQ(table.FindKeyConst(key).ToNumber(-1), wanted);
                const ScriptVal& same = key.IsString() ? table.FindKeyConst(text.c_str())
                                                       : table.FindKeyConst(key.ToNumber());
                ASSERT_EQ(same.ToNumber(-1), wanted);
                found = model.Find(key, true);
                ASSERT_EQ(table.FindKeyNoCaseConst(key)->ToNumber(-1), found ? found->second : -1);
            }
        }
        ASSERT_EQ(Shape(table), model.Shape()) << step << Order(table);
    }
}

TEST(ScriptValTable, ATakenChainIsPutInOrder) {
    std::mt19937 random(7);
    for (int round = 0; round < 300; round++) {
        std::vector<ScriptVal> keys;
        for (unsigned n = random() % 12; n; n--) {
            keys.push_back(random() % 3 ? ScriptVal(n * 0.5) : ScriptVal("text"));
            if (random() % 16 == 0) keys.back() = kNaN;
        }
        std::shuffle(keys.begin(), keys.end(), random);
        const ScriptVal table = Chain(keys), copy(table);
        std::vector<double> numbers, places;
        for (const TableEntry* e = Head(table); e; e = e->m_Next) {
            if (e->m_Key.IsString()) places.push_back(e->m_Value.ToNumber());
            if (!e->m_Key.IsNumber() || e->m_Key != e->m_Key.ToNumber()) continue;
            numbers.push_back(e->m_Key.ToNumber());
            EXPECT_EQ(&table[numbers.back()], &e->m_Value) << Order(table);
        }
        EXPECT_TRUE(std::is_sorted(numbers.begin(), numbers.end())) << Order(table);
        EXPECT_TRUE(std::is_sorted(places.begin(), places.end())) << Order(table);
        EXPECT_EQ(table.NumKeys(), keys.size());
        EXPECT_EQ(Describe(copy), Describe(table));
        EXPECT_EQ(Order(copy), Order(table));
    }
}

// At the sizes and in the kinds where copying takes its short way, and next to them.
TEST(ScriptValTable, ACopyIsTheSameInAllItsFlags) {
    using Change = void (*)(ScriptVal&);
    const Change changes[] = {
        [](ScriptVal&) {},
        [](ScriptVal& t) { t[7] = 1.5f; },
        [](ScriptVal& t) { t.SetFlagsRecurse(SVF_Narrow, SV_Number, false, true); },
        [](ScriptVal& t) { t.SetFlagsRecurse(SVF_Integer, SV_Number, false, true); },
        [](ScriptVal& t) { t.SetFlagsRecurse(0x700100, SV_Table, false, false); },
        [](ScriptVal& t) { t.SetConstructor("name"); },
        [](ScriptVal& t) { t.FindKey(7, 0, SVF_Int); },
        [](ScriptVal& t) { t[7] = "text"; },
        [](ScriptVal& t) { t[7] = SV_Table; },
        [](ScriptVal& t) { t[7] = SV_Nil; },
        [](ScriptVal& t) { t[7] = kNaN; },
        [](ScriptVal& t) { t[0] = t[7.5] = t[1000] = 5; },
        [](ScriptVal& t) { t["text"] = t["Text"] = 5; },
        [](ScriptVal& t) { t[kNaN] = t[kNaN] = 5; },
    };
    const std::vector<double> numbers(200, 1.5);
    for (int size : {63, 64, 65, 66, 200}) {
        for (const Change& change : changes) {
            ScriptVal table, assigned, merged;
            table.TableFromArray(numbers.data(), size);
            change(table);
            const ScriptVal payload(static_cast<ScriptValType>(table.m_Flags), &table.m_Value);
            const std::string same = Describe(table), order = Order(table);
            table.SetFlagsRecurse(SVF_ReadOnly, SV_Number, true, true);  // is not copied
            assigned = table;
            merged += table;
            for (const ScriptVal* copy :
                 std::initializer_list<const ScriptVal*>{&payload, &assigned, &merged}) {
                EXPECT_EQ(Describe(*copy), same) << size << " " << &change - changes;
                EXPECT_EQ(Order(*copy), order);
            }
        }
    }
}

TEST(ScriptValTable, KeysHaveTheFlagsThatAreAskedFor) {
    const double numbers[] = {1.5, -0.0, kNaN};
    ScriptVal table("old");
    table.TableFromArray(numbers, -1);
    EXPECT_EQ(Describe(table), "104:{}");
    table.TableFromArray(numbers, 3);
    EXPECT_EQ(Describe(table), "104:{300001:1=1:1.5 300001:2=1:-0 300001:3=1:nan}");
    table[4] = 1;
    EXPECT_EQ(Order(table), "1 2 3 4");
    auto flags = [&] { return Head(table)->m_Key.m_Flags; };
    table.FindKey(1, SVF_Int, SVF_Int);
    table.SetKey(1, 5);
    table[1] = table[ScriptVal(1.0)] = 6;
    EXPECT_EQ(flags(), 0x300001u);
    table.FindKey(1, SVF_Narrow, SVF_Integer | SVF_Narrow);  // first cleared, then set
    EXPECT_EQ(flags(), 0x100001u);
    table.FindKey(1, 0, SVF_Narrow);
    EXPECT_EQ(flags(), 1u);
    table[ScriptVal(-1)] = 6;
    EXPECT_EQ(flags(), 0x300001u);
}

TEST(ScriptValTable, LookUpsThatFailGiveASentinel) {
    ScriptVal table = MakeTable({{"Key", 1}, {"", 2}});
    const ScriptVal& fixed = table;
    ScriptVal number(5);
    for (const ScriptVal& key : {ScriptVal("none"), ScriptVal(7), ScriptVal(true)}) {
        EXPECT_EQ(&fixed[key], &ScriptVal::nil);
        EXPECT_FALSE(table.FindKeyNoCase(key) || table.FindKeyNoCaseConst(key) ||
                     number.FindKeyNoCase(key) || table.Exists(key) || number.Exists(key));
        number[key] = MakeTable({{"a", 1}});  // is lost
        EXPECT_EQ(Describe(number[key]), "0:nil");
        number[key] = 1;
        EXPECT_TRUE(number.FindKeyConst(key).IsNil() && number.FindKey("ab", 1).IsNil());
    }
    EXPECT_FALSE(number.FindKeyNoCase("ab", 1) || number.FindKeyNoCaseConst("a") ||
                 table.FindKeyNoCaseConst(7.0));
    EXPECT_EQ(&fixed.FindKeyConst("Keys", 4), &ScriptVal::nil);
    EXPECT_TRUE(fixed.FindKeyConst("Keys", 3) == 1 && *table.FindKeyNoCase("KEYS", 3) == 1);
    const char* null = nullptr;
    EXPECT_TRUE(fixed[null].IsNil() || fixed[null] == 2);
    for (int i = 0; i < 2; i++) table.FindKey("\xFFy", 2) = 3;  // never taken for a cell
    EXPECT_EQ(Order(table), "'Key' '' '?y'");
    EXPECT_TRUE(fixed.FindKeyConst("\xFFy", 2) == 3 && *fixed.FindKeyNoCaseConst("\xFFY", 2) == 3);
}

TEST(ScriptValTable, CountsAndWalksWhatIsKept) {
    ScriptVal table(SV_Table, nullptr), number(5);
    table["gone"] = 1;
    table["gone"] = SV_Nil;
    table[ScriptVal()] = 5;
    EXPECT_TRUE(table.Exists("gone") && table.GetKey("read").IsNil() && table.Exists("read"));
    EXPECT_TRUE(table.IsEmpty() && number.IsEmpty() && table.NumKeys() + number.NumKeys() == 0);
    table["kept"] = static_cast<ScriptObject*>(nullptr);
    table.SetKey(1, 2);
    EXPECT_TRUE(!table.IsEmpty() && table.NumKeys() == 2 && table.GetKey(1) == 2);
    std::string keys;
    TableEntry* entry = nullptr;
    while (table.NextKey(entry)) keys += Shape(entry->m_Key);
    EXPECT_EQ(keys, "'kept'1");
    EXPECT_FALSE(entry || number.NextKey(entry));
    number.SetKey("a", 1);
    EXPECT_TRUE(number == 5 && number.GetKey(1).IsNil());
}

TEST(ScriptValTable, WalksPaths) {
    ScriptVal start = MakeTable(
        {{"a", MakeTable({{"b", 1}, {2, "two"}})}, {3, MakeTable()}, {"num", 5}, {"fixed", 6}});
    const std::string same = Shape(start), null = "null";
    auto with = [&](const char* before, const char* after) {
        std::string text = same;
        return text.replace(text.find(before), strlen(before), after);
    };
    struct Case {
        const char* path;
        std::string found;  // by the Const form: a value, nil or null
        std::string made;   // with `create`: the root afterwards
    };
    const Case cases[] = {
        {"a.b", "1", same},
        {"a.2", "'two'", same},
        {"num", "5", same},
        {"a.new", "nil", with("'two'", "'two' 'new'=nil")},
        {"", "nil", with("3={}", "0=nil 3={}")},
        {".", null, with("3={}", "0={0=nil} 3={}")},
        {"3.4", "nil", with("3={}", "3={4=nil}")},
        {"num.y.z", null, with("'num'=5", "'num'={'y'={'z'=nil}}")},
        {"a.b.c", null, with("'b'=1", "'b'={'c'=nil}")},
        {"fixed.y", null, same},
    };
    for (const Case& c : cases) {
        ScriptVal table(start), made(start);
        table["fixed"].m_Flags |= SVF_ReadOnly;  // which copies lose
        made["fixed"].m_Flags |= SVF_ReadOnly;
        const ScriptVal* found = table.FindKeyNestConst(c.path);
        EXPECT_EQ(found ? Shape(*found) : null, c.found) << c.path;
        ScriptVal* reached = made.FindKeyNest(ScriptVal(c.path), true);
        EXPECT_EQ(Shape(made), c.made) << c.path;
        EXPECT_EQ(reached, made.FindKeyNestConst(OxID(c.path))) << c.path;
        EXPECT_EQ(reached == nullptr, strcmp(c.path, "fixed.y") == 0);
        // Without `create` the tables on the way have to be there, and the last key is made.
        EXPECT_EQ(Shape(table), same);
        reached = table.FindKeyNest(c.path, false);
        EXPECT_EQ(reached != nullptr, c.found != null) << c.path;
        EXPECT_EQ(Shape(table), reached ? c.made : same) << c.path;
    }
    EXPECT_TRUE(*start.FindKeyNoCaseNest("A.B", false) == 1);
    EXPECT_TRUE(*start.FindKeyNoCaseNestConst(OxID("A.2")) == "two");
    EXPECT_FALSE(start.FindKeyNoCaseNestConst("A.none") || start.FindKeyNoCaseNest("X.Y", false));
    *start.FindKeyNoCaseNest("A.C.4x.-1", true) = 7;
    EXPECT_TRUE(start["a"]["C"]["4x"][-1] == 7);
    const char* noPath = nullptr;
    ScriptVal args(SV_Args, start.GetData()), number(5);
    EXPECT_FALSE(start.FindKeyNest(noPath, true) || start.FindKeyNest(ScriptVal(5), true) ||
                 start.FindKeyNestConst(ScriptVal()) || start.FindKeyNoCaseNestConst(noPath) ||
                 args.FindKeyNest("a", true) || args.FindKeyNestConst("a") ||
                 args.FindKeyNoCaseNest("a", true) || number.FindKeyNest("a", true));
}

TEST(ScriptValTable, SetsFlagsBelow) {
    const char* const expected[] = {
        "{4:{1:1=1:2}=4:{1:3=1:4} 2:'a'=4:{1:5=1:6}}",
        "{4:{1:1=1:2}=4:{1:3=200001:4} 2:'a'=4:{1:5=200001:6}}",
        "{4:{200001:1=1:2}=4:{1:3=1:4} 2:'a'=4:{1:5=1:6}}",
        "{4:{200001:1=200001:2}=4:{200001:3=200001:4} 2:'a'=4:{200001:5=200001:6}}",
    };
    const ScriptVal plain = MakeTable(
        {{MakeTable({{1.0, 2.0}}), MakeTable({{3.0, 4.0}})}, {"a", MakeTable({{5.0, 6.0}})}});
    for (int what = 0; what < 8; what++) {
        const bool keys = what & 2, values = what & 1;
        ScriptVal v(what & 4 ? SV_Args : SV_Table, plain.GetData());
        v.SetFlagsRecurse(SVF_Integer | 0x0f, SV_Number, keys, values);
        EXPECT_EQ(Describe(v).substr(2), expected[what % 4]);
        v.ClearFlagsRecurse(SVF_Integer | 0xff, SV_Number, keys, values);
        EXPECT_EQ(Describe(v).substr(2), expected[0]);
    }
}

TEST(ScriptValTable, AddsAndTakesAway) {
    uint64_t address = 1;
    const ScriptVal nil, function(SV_Function, &address), b1 = MakeTable({{"b", 1}});
    const ScriptVal nested = MakeTable({{"t", MakeTable({{"a", 1}, {"b", 2}})}, {1, "x"}});
    struct Case {
        ScriptVal left, right;
        const char *sum, *difference;
    };
    const Case cases[] = {
        {nil, 5, "5", "nil"},
        {5, nil, "5", "5"},
        {5, 6, "6", "5"},
        {5, "5", "5", "5"},
        {function, function, "1", "1"},
        {5, b1, "5", "5"},
        {nil, nested, "{'t'={'a'=1 'b'=2} 1='x'}", "nil"},
        {nested, nested, "{'t'={'a'=1 'b'=2} 1='x'}", "nil"},
        {nested, MakeTable({{"t", MakeTable({{"b", 3}, {"c", 4}})}, {0, 5}}),
         "{'t'={'a'=1 'b'=3 'c'=4} 0=5 1='x'}", "{'t'={'a'=1 'b'=2} 1='x'}"},
        {nested, MakeTable({{"t", MakeTable({{"b", 2}, {"a", 1}})}}), "{'t'={'a'=1 'b'=2} 1='x'}",
         "{'t'=nil 1='x'}"},
        {nested, MakeTable({{"t", MakeTable({{"b", 2}})}, {1, "x"}}), "{'t'={'a'=1 'b'=2} 1='x'}",
         "{'t'={'a'=1 'b'=nil} 1=nil}"},
        {MakeTable({{"b", nil}}), b1, "{'b'=1}", "nil"},
        {MakeTable({{"a", nil}, {"b", 1}}), b1, "{'a'=nil 'b'=1}", "{'a'=nil 'b'=nil}"},
    };
    for (const Case& c : cases) {
        ScriptVal sum(c.left), difference(c.left);
        EXPECT_EQ(Shape(sum += c.right), c.sum) << &c - cases;
        EXPECT_EQ(Shape(difference -= c.right), c.difference) << &c - cases;
    }
    ScriptVal fixed = MakeTable({{"a", 1}, {"t", MakeTable({{"b", 1}})}});
    for (const char* key : {"a", "t"}) fixed[key].m_Flags |= SVF_ReadOnly;
    fixed += MakeTable({{"a", 2}, {"t", MakeTable({{"b", 2}, {"c", 3}})}});
    EXPECT_EQ(Shape(fixed), "{'a'=1 't'={'b'=1}}");
}

TEST(ScriptValTable, Translates) {
    ScriptVal text = MakeTable({{1, "text"}, {2, "comment"}, {3, 5}, {4, "own"}});
    ScriptVal plain = MakeTable({{1, "plain"}}), other = plain;
    for (ScriptVal* v : {&text, &plain}) v->SetConstructor("__tr");
    other.SetConstructor("__TR");
    const ScriptVal all =
        MakeTable({{"a", text}, {2, MakeTable({{plain, plain}})}, {"c", other}, {"d", "text"}});
    ScriptVal args(SV_Args, all.GetData()), number(5), table(all);
    EXPECT_TRUE(args.Translate("domain") == 2 && number.Translate("domain") == 0);
    EXPECT_EQ(Shape(args),
              "{'a'='text' 2={__tr{1='plain'}='plain'} 'c'=__TR{1='plain'} 'd'='text'}");
    g_Translate = [](const char* domain, const char* word, const char* comment, long long count) {
        OxStringT<char> out;
        out.PrintF("%s|%s|%s|%lld", domain ? domain : "-", word, comment ? comment : "-", count);
        return out;
    };
    EXPECT_TRUE(table.Translate("domain") == 2 && plain.Translate(nullptr) == 1);
    g_Translate = nullptr;
    EXPECT_TRUE(table["a"] == "own|text|comment|5" && plain == "-|plain|-|-1");
    EXPECT_TRUE(Head(table[2])->m_Value == "domain|plain|-|-1");
}

TEST(ScriptValTable, TellsErrors) {
    struct Case {
        int code;
        const char* text;
    };
    const Case cases[] = {{0, "none"},
                          {1, "Unknown Error"},
                          {10, "Invalid RemoteObject."},
                          {11, "Unknown error number 11."},
                          {-1, "Unknown error number -1."}};
    for (const Case& c : cases) {
        ScriptVal args(SV_Args, nullptr);
        args.SetError(static_cast<ScriptError>(c.code));
        EXPECT_STREQ(args["ErrorString"].ToString("none"), c.text);
        EXPECT_TRUE(args["Error"] == c.code && args["Error"].m_Flags == 0x300001);
    }
    ScriptVal table(SV_Table, nullptr), number(5);
    table.SetError(SCERR_None, "own");
    table["Error"].m_Flags |= SVF_ReadOnly;
    table.SetError(SCERR_InvalidIndex, "other");
    EXPECT_EQ(Shape(table), "{'Error'=0 'ErrorString'='other'}");
    number.SetError(SCERR_Unknown);
    EXPECT_TRUE(number == 5);
}

}  // namespace
}  // namespace Korvel

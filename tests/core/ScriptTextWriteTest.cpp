// Values as they are written: the text form, byte by byte, and JSON.
#include <gtest/gtest.h>

#include <bit>
#include <clocale>
#include <cmath>
#include <fstream>
#include <iterator>
#include <random>
#include <thread>

#include "ScriptValFakes.h"
#include "Support.h"
#include "core/FaultsInternal.h"
#include "core/NumbersInternal.h"
#include "core/ScriptVal.h"

namespace Korvel {
namespace {

using namespace Test;

// By way of the buffer, which has just the room that was told.
std::string Text(const ScriptVal& value, unsigned int options = 0, int indent = 0) {
    int length = value.ToTextLen(indent, options);
    if (length < 0) return "(none)";
    std::vector<char> buffer(static_cast<size_t>(length) + 1, '?');
    EXPECT_EQ(value.ToText(buffer.data(), indent, options), buffer.data() + length);
    EXPECT_EQ(buffer.back(), '\0');
    OxStringT<char> text("old");
    EXPECT_TRUE(value.ToText(text, indent, options));
    EXPECT_STREQ(text, buffer.data());
    return text.GetLength() == length ? buffer.data() : "(another length)";
}

ScriptVal WithFlags(ScriptVal value, uint32_t flags, const char* constructor = nullptr) {
    value.m_Flags |= flags;
    if (constructor) value.SetConstructor(constructor);
    return value;
}

// A table of entries in just this order.
ScriptVal Chained(const std::vector<std::pair<ScriptVal, ScriptVal>>& entries) {
    ScriptVal table(SV_Table, nullptr);
    TableEntry** link = &table.m_Value.m_Table.m_Table;
    for (const auto& [key, value] : entries) {
        auto* entry = new TableEntry(key);
        entry->m_Value = value;
        *link = table.m_Value.m_Table.m_Last = entry;
        link = &entry->m_Next;
    }
    return table;
}

ScriptVal Nested(int levels) {
    ScriptVal value = 1;
    for (int i = 0; i < levels; i++) value = Chained({{"k", std::move(value)}});
    return value;
}

MemBlock Bytes(const std::string& bytes) {
    return MemBlock(const_cast<char*>(bytes.data()), static_cast<uint32_t>(bytes.size()));
}

TEST(ScriptTextWrite, SingleValues) {
    FakeWire wire;
    FakeObject object;
    ScriptVal dead;
    {
        FakeObject mortal;
        dead = &mortal;
    }
    uint64_t address = 0x123456789ABCDEF0;
    auto hex = [](const char* tag, const void* pointer) {
        char text[40];
        snprintf(text, sizeof text, "%s<%016llx>", tag,
                 reinterpret_cast<unsigned long long>(pointer));
        return std::string(text);
    };
    struct Case {
        ScriptVal value;
        std::string text;
        std::string reference = "";  // with option 4, where that differs
    };
    const Case cases[] = {
        {ScriptVal(), "nil"},
        {ScriptVal(SV_Nil | SVF_KeptNil, nullptr), "nil"},
        {ScriptVal("code", 4u, 0), "nil"},
        {1.0, "1"},
        {0.1, "0.1"},
        {0.1f, "0.1"},
        {1234567.5f, "1.23457e+06"},
        {ScriptVal(SV_Number | SVF_Int, &(const double&)1e300), "9223372036854775807"},
        {ScriptVal(SV_Number | SVF_Integer, &(const double&)-7.9), "-7"},
        {HUGE_VAL, "inf"},
        {ScriptVal(SV_Number | SVF_Integer, &(const double&)NAN), "0"},
        {true, "true"},
        {false, "false"},
        {"", "\"\""},
        {"a\\b\"c'd\ne\rf\tg\x80\x01", "\"a\\\\b\\\"c'd\\ne\\rf\tg\x80\x01\""},
        {"the escape stands at the very end\n", "\"the escape stands at the very end\\n\""},
        {ScriptVal(SV_Function, &address), "nil", "func<123456789abcdef0>"},
        {ScriptVal(SV_Pointer, &address), "nil", "ptr<123456789abcdef0>"},
        {wire.ProxyValue(0), "nil", hex("robj", wire.Proxy(0))},
        {&object, "nil", hex("lobj", static_cast<ScriptObject*>(&object))},
        {Bytes(""), "HexData [[ ]]"},
        {Bytes(std::string("\0\x11", 2)), "HexData [[ 00 11 ]]"},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(Text(c.value), c.text);
        EXPECT_EQ(Text(c.value, TXT_References), c.reference.empty() ? c.text : c.reference);
    }
    EXPECT_EQ(Text(dead, TXT_References), "lobj<0000000000000000>");
    EXPECT_EQ(Text("a'b\"", TXT_SingleQuotes), "'a\\'b\"'");
}

TEST(ScriptTextWrite, BlocksTakeSixteenBytesALine) {
    const std::string row = "41 41 41 41 41 41 41 41 41 41 41 41 41 41 41 41\n";
    const std::string bytes(33, 'A');
    EXPECT_EQ(Text(Bytes(bytes.substr(0, 16)), 0, 1), "HexData [[ " + row + "\t\t]]");
    EXPECT_EQ(Text(Bytes(bytes)), "HexData [[\n\t" + row + "\t" + row + "\t41 ]]");
    EXPECT_EQ(Text(Bytes(bytes), 0, -1), "HexData [[\n" + row + row + "41 ]]");
    EXPECT_EQ(Text(MakeTable({{"m", Bytes(bytes.substr(0, 17))}}), TXT_Compact, -1),
              "{ m = HexData [[\n\t" + row + "\t41 ]] }");
}

TEST(ScriptTextWrite, Tables) {
    const ScriptVal list = MakeTable({{1, 5}, {2, 6}});
    const ScriptVal inner = MakeTable({{"a", 1}, {"b", list}});
    const ScriptVal skipped = Chained({{"a", 1}, {"n", ScriptVal()}});
    struct Case {
        ScriptVal value;
        unsigned int options;
        const char* text;
    };
    const Case cases[] = {
        {MakeTable(), 0, "{\n}"},
        {MakeTable(), TXT_Compact, "{ }"},
        {MakeTable(), TXT_Flat, "\n"},
        {inner, 0, "{\n\ta = 1,\n\tb = {\n\t\t5,\n\t\t6\n\t}\n}"},
        {inner, TXT_Compact, "{ a = 1, b = { 5, 6 } }"},
        {MakeTable({{"t", WithFlags(list, SVF_Compact)}}), 0, "{\n\tt = { 5, 6 }\n}"},
        {inner, TXT_Flat, "\n\ta = 1\n\tb = \n\t\t5\n\t\t6\n"},
        {list, TXT_Flat | TXT_Compact, "\n5 6 "},
        {MakeTable({{1, list}, {2, 7}}), TXT_Flat | TXT_Compact, "\n\n5 6 7 "},
        // The comma follows the next entry, also one that is skipped.
        {skipped, TXT_Compact, "{ a = 1, }"},
        {Chained({{ScriptVal(), 1}, {"k", ScriptVal(SV_Nil | SVF_KeptNil, nullptr)}, {"b", 2}}),
         TXT_Compact, "{ b = 2 }"},
        // Keys.
        {Chained({{1, "a"}, {2, "b"}, {4, "d"}, {3, "c"}}), TXT_Compact,
         "{ \"a\", \"b\", [4] = \"d\", \"c\" }"},
        {MakeTable({{0.5, 1}, {-1, 2}, {2.0f, 3}}), TXT_Compact,
         "{ [-1] = 2, [0.5] = 1, [2] = 3 }"},
        {WithFlags(list, SVF_ExplicitKeys), TXT_Compact, "{ [1] = 5, [2] = 6 }"},
        {Chained({{true, 1}, {list, 2}, {1, 3}}), TXT_Compact, "{ 1, 2, 3 }"},
        {Chained(
             {{"_a1", 1}, {"end", 2}, {"End", 3}, {"a b", 4}, {"1a", 5}, {"", 6}, {"\xC3\xA4", 7}}),
         TXT_Compact,
         "{ _a1 = 1, [\"end\"] = 2, End = 3, [\"a b\"] = 4, [\"1a\"] = 5, [\"\"] = 6, "
         "[\"\xC3\xA4\"] = 7 }"},
        {MakeTable({{"a'\n", "'"}}), TXT_Compact | TXT_SingleQuotes, "{ ['a\\'\\n'] = '\\'' }"},
        // Heads. The flags of an args list tell something else.
        {WithFlags(inner, SVF_Ordered), TXT_Compact, "ordered() { a = 1, b = { 5, 6 } }"},
        {WithFlags(list, 0, "A.B"), TXT_Compact, "A.B { 5, 6 }"},
        {WithFlags(list, SVF_Ordered, "Name"), 0, "ordered() (Name {\n\t5,\n\t6\n})"},
        {WithFlags(list, SVF_Ordered, "Name"), TXT_Flat, "\n\t5\n\t6\n"},
        {ScriptVal(SV_Args | SVF_ReplyDeferred | SVF_ExplicitKeys, list.GetData()), TXT_Compact,
         "{ 5, 6 }"},
        // A constructor that is no path of names.
        {WithFlags(list, 0, "os.exit() --"), TXT_Compact, "{ __ctor = \"os.exit() --\", 5, 6 }"},
        {WithFlags(MakeTable(), SVF_Ordered, "A.end"), 0, "ordered() {\n\t__ctor = \"A.end\"\n}"},
        {WithFlags(MakeTable(), 0, "A..B"), TXT_SingleQuotes | TXT_Compact, "{ __ctor = 'A..B' }"},
        {WithFlags(MakeTable(), 0, ""), TXT_Compact, "{ __ctor = \"\" }"},
    };
    for (const Case& c : cases) EXPECT_EQ(Text(c.value, c.options), c.text);
    for (const char* word : {"and", "break",    "do",     "else", "elseif", "end",   "false",
                             "for", "function", "if",     "in",   "local",  "nil",   "not",
                             "or",  "repeat",   "return", "then", "true",   "until", "while"}) {
        EXPECT_EQ(Text(MakeTable({{word, 1}}), TXT_Compact),
                  std::string("{ [\"") + word + "\"] = 1 }");
    }
    EXPECT_EQ(Text(inner, 0, 1), "{\n\t\ta = 1,\n\t\tb = {\n\t\t\t5,\n\t\t\t6\n\t\t}\n\t}");
    EXPECT_EQ(Text(inner, 0, -1), "{\na = 1,\nb = {\n\t5,\n\t6\n}\n}");
    EXPECT_EQ(Text(MakeTable(), TXT_Flat, -1), "");
}

TEST(ScriptTextWrite, CompactTablesBreakTheirLineAfter256Entries) {
    ScriptVal list(SV_Table, nullptr);
    std::string expected = "{ ";
    for (int i = 1; i <= 513; i++) {
        list.FindKey(i) = 7;
        expected += i == 257 || i == 513 ? "\t\t7" : "7";
        if (i < 513) expected += ",";
        expected += i % 256 == 0 ? "\n" : " ";
    }
    EXPECT_EQ(Text(list, TXT_Compact, 1), expected + "}");
}

// The position is a float, which ends at 2^24.
TEST(ScriptTextWrite, ThePositionStopsGrowing) {
    ScriptVal list(SV_Table | SVF_Compact, nullptr);
    for (int i = 1; i <= (1 << 24) + 1; i += 1) {
        if (i == 4) i = 1 << 24;
        list.FindKey(i) = 7;
    }
    EXPECT_EQ(Text(list), "{ 7, 7, 7, [16777216] = 7, [16777217] = 7 }");
}

// Of all kinds, also such as cannot be read back.
class RandomValues {
public:
    ScriptVal Make(int levels) {
        constexpr unsigned kKinds = 8;
        unsigned kind = Next(levels > 0 ? 2 * kKinds : kKinds);
        if (kind >= kKinds) return MakeTable(levels);
        switch (kind) {
            case 0:
                return static_cast<int>(m_Random());
            case 1:
                return Next(1'000'000) / 1000.0;
            case 2:
                return Next(2) == 0;
            case 3:
                return Bytes(MakeText(40));
            case 4:
                return MakeText(30).c_str();
            case 5:
                return std::bit_cast<double>(m_Random());
            case 6:
                return static_cast<float>(Next(1'000'000)) / 1000;
            default:
                return ScriptVal(SV_Pointer, &static_cast<const uint64_t&>(m_Random()));
        }
    }

private:
    unsigned Next(unsigned end) { return static_cast<unsigned>(m_Random() % end); }

    std::string MakeText(unsigned end) {
        static constexpr char kBytes[] = "abcdefghijk_01 \\\"'\n\r\t\x7f\x80";
        std::string text;
        for (unsigned i = Next(end); i > 0; i--) text += kBytes[Next(sizeof kBytes - 1)];
        return text;
    }

    ScriptVal MakeTable(int levels) {
        ScriptVal table(SV_Table, nullptr);
        for (unsigned i = Next(6); i > 0; i--) table.FindKey(Next(6)) = Make(levels - 1);
        for (unsigned i = Next(6); i > 0; i--) {
            table.FindKey(MakeText(6).c_str()) = Make(levels - 1);
        }
        table.FindKey(Make(1)) = 1;
        table.m_Flags |= m_Random() & (SVF_Compact | SVF_Ordered | SVF_ExplicitKeys);
        if (Next(3) == 0) table.SetConstructor(Next(2) ? "A.B" : MakeText(6).c_str());
        return table;
    }

    std::mt19937_64 m_Random{7};
};

TEST(ScriptTextWrite, TheLengthIsThatOfTheText) {
    RandomValues values;
    for (int i = 0; i < 500; i++) {
        ScriptVal value = values.Make(4);
        for (unsigned int options = 0; options < 16; options++) {
            for (int indent : {-2, -1, 0, 3}) ASSERT_NE(Text(value, options, indent), "(none)");
        }
    }
}

TEST(ScriptTextWrite, NumbersAreThoseOfPrintf) {
    auto check = [](double number) {
        char own[kNumberTextSize + 1], text[64];
        snprintf(text, sizeof text, "%.15g", number);
        *WriteDouble(own, number) = '\0';
        ASSERT_STREQ(own, text);
        snprintf(text, sizeof text, "%g", number);
        *WriteFloat(own, number) = '\0';
        ASSERT_STREQ(own, text);
    };
    std::mt19937_64 random(3);
    for (int i = 0; i < 100'000; i++) {
        check(std::bit_cast<double>(random()));
        double whole = static_cast<double>(random() >> 11);
        check(std::ldexp(whole, static_cast<int>(random() % 70) - 80));
        check(std::round(whole / 1e8) / std::pow(10, random() % 14));
        check(static_cast<double>(random() % 4'000'000) / 2);  // halves, which are rounded to even
    }
    for (int exponent = -6; exponent < 23; exponent++) {
        double power = std::pow(10, exponent);
        for (double number : {power, std::nextafter(power, 0), std::nextafter(power, HUGE_VAL),
                              9.999995 * power, 9.99999999999999 * power, -power}) {
            check(number);
        }
    }
    for (double number : {0.0, -0.0, 5e-324, HUGE_VAL, -HUGE_VAL, std::nan(""), -std::nan("")}) {
        check(number);
    }
}

TEST(ScriptTextWrite, TheLocaleIsCAfterwards) {
    for (int round = 0; round < 20; round++) {
        ASSERT_TRUE(setlocale(LC_ALL, "C.UTF-8"));
        Text(0.5, 0, 1);
        EXPECT_STREQ(setlocale(LC_ALL, nullptr), "C.UTF-8");
        std::vector<std::thread> threads;
        for (int i = 0; i < 4; i++) threads.emplace_back([] { ScriptVal(0.5).ToTextLen(0, 0); });
        for (std::thread& thread : threads) thread.join();
        EXPECT_STREQ(setlocale(LC_ALL, nullptr), "C");
    }
}

TEST(ScriptTextWrite, Limits) {
    const ScriptVal deep = Nested(kMaxNesting), deeper = Nested(kMaxNesting + 1);
    EXPECT_EQ(Text(deep, TXT_Compact).size(), kMaxNesting * strlen("{ k =  }") + 1);
    EXPECT_EQ(Text(deeper), "(none)");
    OxStringT<char> text("old");
    EXPECT_TRUE(!deeper.ToText(text, 0, 0) && text.IsEmpty());

    // The tabs of one entry are as many as fit, or one more.
    const ScriptVal table = WithFlags(MakeTable({{"m", Bytes(std::string(17, 'A'))}}), SVF_Compact);
    EXPECT_EQ(table.ToTextLen(INT32_MAX, 0), -1);
    EXPECT_FALSE(table.ToText(text, INT32_MAX, 0));
    const int fixed = table.ToTextLen(-2, 0);
    constexpr int kIndent = INT32_MAX / 2 - 100;
    EXPECT_EQ(table.ToTextLen(kIndent, 0), fixed + 2 * (kIndent + 2));

    TempDir directory;
    const std::string path = directory.Write("kept", "old");
    EXPECT_FALSE(deeper.Save(path.c_str(), 0));
    EXPECT_FALSE(deep.Save(directory.Path("no/file").c_str(), 0));
    EXPECT_FALSE(deep.Save("/dev/full", 0));
    auto content = [&path] {
        std::ifstream file(path, std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(file), {});
    };
    EXPECT_EQ(content(), "old");
    EXPECT_TRUE(deep.Save(path.c_str(), TXT_Compact));
    EXPECT_EQ(content(), Text(deep, TXT_Compact));
}

std::string Json(const ScriptVal& value) {
    OxStringT<char> out;
    if (!value.ToJSON(out)) return "(none)";
    std::string json;
    for (const char* c = out; *c; c++) {
        if (*c != '\n' && *c != '\t') json += *c;
    }
    return json;
}

TEST(ScriptJSON, Writes) {
    FakeObject object;
    const ScriptVal list = MakeTable({{"k", "v"}, {2, 2}, {1, ScriptVal()}});
    const std::pair<ScriptVal, const char*> cases[] = {
        {ScriptVal(), "null"},
        {0.1, "0.1"},
        {1.0 / 3, "0.33333333333333331"},
        {ScriptVal(NAN), "null"},
        {-HUGE_VAL, "null"},
        {true, "true"},
        {"a\"\n\x01", "\"a\\\"\\n\\u0001\""},
        {MakeTable(), "{}"},
        {list, "[\"v\",null,2]"},  // in the order of the chain
        {MakeTable({{"a", list}, {2, "left out"}, {"", false}}),
         "{\"a\":[\"v\",null,2],\"\":false}"},
        {MakeTable({{"o", &object}, {"m", Bytes("x")}, {"n", 1}}), "{\"n\":1}"},
        {MakeTable({{1, &object}, {2, 1}}), "[1]"},
        {&object, "(none)"},
        {ScriptVal(SV_Args, list.GetData()), "(none)"},
        {Nested(kMaxNesting + 1), "(none)"},
    };
    for (const auto& [value, json] : cases) {
        std::string written = Json(value);
        std::erase(written, ' ');
        EXPECT_EQ(written, json);
    }
    EXPECT_NE(Json(Nested(kMaxNesting)), "(none)");
}

TEST(ScriptJSON, Reads) {
    const std::pair<const char*, const char*> cases[] = {
        {"null", "nil"},
        {"-1.5e3", "-1500"},
        {"1e400", "nil"},
        {"true", "true"},
        {"\"a\\u00e9\\\\u0000\"", "\"a\xC3\xA9\\\\u0000\""},
        {"[]", "{ }"},
        {"[1, null, [\"x\"]]", "{ 1, [3] = { \"x\" } }"},
        {"{\"b\": 1, \"a\": 2, \"b\": {\"c\": 3}, \"B\": 4}", "{ b = { c = 3 }, a = 2, B = 4 }"},
    };
    for (const auto& [json, text] : cases) {
        ScriptVal value("old");
        EXPECT_TRUE(value.FromJSON(json)) << json;
        EXPECT_EQ(Text(value, TXT_Compact), text);
    }
    ScriptVal list;
    EXPECT_TRUE(list.FromJSON("[null]"));
    EXPECT_EQ(list.m_Value.m_Table.m_Table->m_Key.m_Flags, SV_Number | SVF_Int);

    const std::string open(kMaxNesting, '['), close(kMaxNesting, ']');
    const std::string refused[] = {"",
                                   "{",
                                   "\"\\u0000\"",
                                   "{\"a\\u0000b\": 1}",
                                   "\"\xFFx\"",
                                   "[{\"\xFF\": 1}]",
                                   "[" + open + close + "]",
                                   std::string(100'000, '[')};
    for (const std::string& json : refused) {
        ScriptVal value("old");
        EXPECT_FALSE(value.FromJSON(json.c_str())) << json.substr(0, 20);
        EXPECT_TRUE(value == "old");
    }
    EXPECT_TRUE(list.FromJSON((open + close).c_str()));
    list.m_Flags |= SVF_ReadOnly;
    EXPECT_FALSE(list.FromJSON("1"));
}

// Looking each key up in the chain would take hours.
TEST(ScriptJSON, ReadsManyKeys) {
    constexpr int kCount = 300'000;
    std::string json = "{\"key0\": -1";
    for (int i = 0; i < kCount; i++)
        json += ",\"key" + std::to_string(i) + "\": " + std::to_string(i);
    ScriptVal value;
    ASSERT_TRUE(value.FromJSON((json + "}").c_str()));
    EXPECT_EQ(value.NumKeys(), unsigned{kCount});
    EXPECT_TRUE(value["key0"] == 0);
}

#ifdef KORVEL_FAULTS
TEST(ScriptTextWrite, MemoryRunsOut) {
    const ScriptVal value = MakeTable({{"key", "text"}, {"list", MakeTable({{1, "x"}, {2, 2}})}});
    const std::string text = Text(value);
    TempDir directory;
    const std::string path = directory.Path("file");
    const char* json = "{\"a\": [1, \"b\"], \"c\": {\"d\": \"e\"}}";
    for (unsigned n = 1;; n++) {
        OxStringT<char> out;
        ScriptVal read("old");
        Faults::FailAt(n, false);
        bool hasText = value.ToText(out, 0, 0);
        bool isSaved = value.Save(path.c_str(), 0);
        bool hasRead = read.FromJSON(json);
        bool isComplete = Faults::Stop() < n;
        EXPECT_EQ(out == text.c_str(), hasText);
        EXPECT_EQ(isSaved || hasText, true);  // only one of them fails
        EXPECT_EQ(hasRead ? Text(read, TXT_Compact) : Text(read),
                  hasRead ? "{ a = { 1, \"b\" }, c = { d = \"e\" } }" : "\"old\"");
        if (isComplete) {
            EXPECT_TRUE(hasText && isSaved && hasRead);
            break;
        }
    }
}
#endif

}  // namespace
}  // namespace Korvel

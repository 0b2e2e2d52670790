#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <random>
#include <string>
#include <thread>

#include "ScriptValFakes.h"
#include "Support.h"
#include "core/FaultsInternal.h"
#include "core/ScriptText.h"
#include "core/ScriptTextInternal.h"

namespace {

using namespace Korvel;
using Test::Describe;
using Test::Shape;

// What came of a reading: the value, or "! " and the message.
std::string Outcome(bool isRead, const ScriptVal& value, const char* err) {
    if (isRead) return Shape(value);
    EXPECT_TRUE(value.IsNil());
    return std::string("! ") + err;
}

std::string Read(const std::string& text) {
    ScriptVal value(1);
    char err[300] = "=t";
    bool isRead = value.FromText(text.c_str(), GetSerializePrologue(), err, sizeof err, false, 0);
    return Outcome(isRead, value, err);
}

std::string ReadByName(const std::string& text, const char* name) {
    ScriptVal value(1);
    char err[300] = "=t";
    bool isRead = value.FromTextByName(text.c_str(), name, err, sizeof err, false, 0);
    return Outcome(isRead, value, err);
}

std::string ReadForeign(const std::string& text) {
    ScriptVal value(1);
    char err[300] = "=t";
    bool isRead = FromForeignText(value, text.c_str(), err, sizeof err);
    return Outcome(isRead, value, err);
}

struct Case {
    std::string text;
    std::string outcome;
};

// Programs of values, run before the `return` of a text.
std::string Program(const std::string& body) {
    return "(function() " + body + " end)()";
}

TEST(ScriptTextRead, Values) {
    const Case cases[] = {
        {"1.5", "1.5"},
        {"'a\\\"b\\n'", "'a\"b\n'"},
        {"", "nil"},
        {"false", "false"},
        {"{ 1, nil, 3, x = true, [10] = 2, [-1] = 1, [2.5] = 0 }",
         "{-1=1 1=1 2.5=0 3=3 10=2 'x'=true}"},
        {"{ [true] = 1, 2 }", "{1=2 true=1}"},
        {"{ [{ a = 'key' }] = 'v' }", "{{'a'='key'}='v'}"},
        {"'a\\0b'", "[" + std::string("a\0b", 3) + "]"},
        {"{ '\\255' }", "{1=[\xff]}"},
        {"{ ['k\\0'] = 1 }", "{[" + std::string("k\0", 2) + "]=1}"},
        {"{ ['\\255x'] = 1 }", "! A key or constructor begins with byte 255."},
        {"{ __ctor = '\\255x' }", "! A key or constructor begins with byte 255."},
        {"{ __ctor = 'Any name', 1 }", "Any name{1=1}"},
        {"{ __ctor = 12.5, __flags = 'none', { __ctor = {} } }", "12.5{1={}}"},
        {"tr('text', nil, 3)", "__tr{1='text' 3=3}"},
        {"_Lua 'x = 1'", "'x = 1'"},
        {"UTF8_ELLIPSIS", "'\xE2\x80\xA6'"},
        {"string.gfind == string.gmatch and math.mod == math.fmod and ('abc'):len()", "3"},
        {"{ io, os, debug, package, require }",
         "{1={'Name'='io'} 2={'Name'='os'} "
         "3={'Name'='debug'} 4={'Name'='package'} "
         "5={'Name'='require'}}"},
        // constructors
        {"A.B { x = 1 }", "A.B{'x'=1}"},
        {"Foo(1)('two') { 3 }", "Foo{1=3 '__args'={1=1 2='two'}}"},
        {"Foo(1, 2) {}", "Foo{'__args'={1=1}}"},
        {"{ inf, A { A {} } }", "{1={'Name'='inf'} 2=A{1=A{}}}"},
        {"-inf", "! t:1: attempt to perform arithmetic on global 'inf' (a table value)"},
        {"A { } .. B", "! t:1: attempt to concatenate a table value"},
        // order, whoever makes tables before the one in braces
        {"ordered() { z = 1, y = 2, x = { c = 1 } }", "{'z'=1 'y'=2 'x'={'c'=1}}"},
        {"ordered() (Name { z = 1, y = 2, x = 3 })", "Name{'z'=1 'y'=2 'x'=3}"},
        {"ordered() (A.B(7)(8) { z = 1, y = 2 })", "A.B{'z'=1 'y'=2 '__args'={1=7 2=8}}"},
        {"ordered() (tr { z = 1, y = 2, x = 3 })", "__tr{1={'z'=1 'y'=2 'x'=3}}"},
        // failures
        {"{ 1,\n 2", "! t:2: '}' expected (to close '{' at line 1) near '<eof>'"},
        {"\n\n nil + 1", "! t:3: attempt to perform arithmetic on a nil value"},
        {Program("error({})"), "! "},
        {"{ coroutine.create(tr) }", "! Unsupported type for custom data!"},
        {"newproxy()", "! Unsupported type for custom data!"},
        {std::string(300, '{') + std::string(300, '}'), "! t:1: chunk has too many syntax levels"},
        {Program("local t = {} for i = 2, 257 do t = { t } end return t"),
         "! Table nested too deeply."},
        {Program("local t = {} t[t] = 1 return t"), "! Table nested too deeply."},
    };
    for (const Case& c : cases) EXPECT_EQ(Read(c.text), c.outcome) << c.text;
    ScriptVal deep;
    const std::string just = Program("local t = {} for i = 2, 256 do t = { t } end return t");
    EXPECT_TRUE(deep.FromText(just.c_str()));
}

TEST(ScriptTextRead, FlagsOfTables) {
    constexpr uint32_t table = SV_Table;
    const struct {
        const char* text;
        uint32_t flags;
    } cases[] = {
        {"{}", table | SVF_ExplicitKeys},
        {"{ a = 1 }", table | SVF_ExplicitKeys | SVF_Compact},
        {"{ 1 }", table | SVF_Compact},
        {"{\n1 }", table},
        {"{\na = 1 }", table | SVF_ExplicitKeys},
        {"ordered() {\n1 }", table | SVF_Ordered},
        {"ordered() (A { 1 })", table | SVF_Ordered | SVF_Compact},
        {"{\n1, __flags = 0x400013 }", table | SVF_List},
        {"{\n1, __flags = 0x200 }", table | SVF_ReadOnly},
        {"{\n1, __flags = -1 }", table | 0xffffff00},
        {"tr 'x'", table | SVF_Compact},
    };
    for (const auto& c : cases) {
        ScriptVal value;
        EXPECT_TRUE(value.FromText(c.text));
        EXPECT_EQ(value.m_Flags, c.flags) << c.text;
        if (*c.text == '{' && c.text[1] == '\n' && c.text[2] == '1') {
            EXPECT_EQ(Shape(value), "{1=1}");
        }
    }
    ScriptVal foreign;
    EXPECT_TRUE(FromForeignText(foreign, "{ 1, __flags = -1 }", nullptr, 0));
    EXPECT_EQ(foreign.m_Flags & (SVF_ReadOnly | SVF_FromWire), 0u);
}

TEST(ScriptTextRead, ByName) {
    const std::string text =
        "window = { width = 5 }\nmode = A.B { ordered() (C { z = 1, y = 2 }) } -- the end";
    EXPECT_EQ(ReadByName(text, "window"), "{'width'=5}");
    EXPECT_EQ(ReadByName(text, "window.width"), "5");
    EXPECT_EQ(ReadByName(text, "mode"), "A.B{1=C{'z'=1 'y'=2}}");
    EXPECT_EQ(ReadByName(text, "other"), "{'name'='other'}");
    EXPECT_EQ(ReadByName("x = string and 1 or 2", "x"), "1");  // a record
    EXPECT_EQ(ReadByName("x = Foo(1)", "x"), "! t:1: attempt to index local 'a' (a number value)");
    const std::string longName = "n" + std::string(1000, 'a');
    EXPECT_EQ(ReadByName(longName + " = 7", longName.c_str()), "7");
    for (const char* name : {"", "x y", "x)", "1x", "x..y", ".x", "x.", "end", "a.end", "x\n"}) {
        EXPECT_EQ(ReadByName("x = 1", name), "! The name is no identifier.");
    }
    EXPECT_EQ(ReadByName("x = 1", nullptr), "! The name is no identifier.");
    Korvel::Test::TempDir dir;
    const std::string included = dir.Write("part.txt", "y = tr 'in'");
    EXPECT_EQ(ReadByName("include '" + included + "'", "y"), "__tr{1='in'}");
    EXPECT_EQ(Read("include"), "{'Name'='include'}");
}

TEST(ScriptTextRead, Blocks) {
    const Case cases[] = {
        {"HexData [[ ]]", "[]"},
        {"HexData [[ 41 42\n\t\t43]]", "[ABC]"},
        {"HexData '1F41 0x42 -bd g 44'", "[ABC]"},
        {"{ HexData(1) == nil, HexData() == nil, MemBlock(0) == nil, MemBlock {} == nil, "
         "MemBlock(1e18) == nil, MemBlock(0/0) == nil }",
         "{1=true 2=true 3=true 4=true 5=true 6=true}"},
        {Program("local m = MemBlock(3.9) m[1] = 65 m[2] = 322 m[3] = 67 m[4] = 1 m[0] = 1 "
                 "m.x = 1 return { m, m[3], m.Size, m[4] == nil, m.x == nil, tostring(m) }"),
         "{1=[ABC] 2=67 3=3 4=true 5=true 6='MemBlock (3 bytes)'}"},
        {Program("local m = MemBlock(1) m[1] = 65 m[1] = {} return m[1]"), "0"},
        // its methods, called with what they were not made for
        {Program("local m = HexData '41' local t = getmetatable(m) t.__gc(m) t.__gc(m) "
                 "t.__gc(newproxy()) t.__gc() t.__newindex(1, 2, 3) "
                 "return { m, m[1] == nil, m.Size == nil, t.__tostring(m) == nil, "
                 "t.__index() == nil }"),
         "{1=[] 2=true 3=true 4=true 5=true}"},
        {Program("local last for i = 1, 3000 do last = MemBlock(1000) last[1] = i % 256 end "
                 "collectgarbage() return last[1]"),
         "184"},
    };
    for (const Case& c : cases) EXPECT_EQ(Read(c.text), c.outcome) << c.text;
    ScriptVal value;
    EXPECT_TRUE(value.FromText("MemBlock(2)"));
    EXPECT_EQ(value.ToMemBlock().m_Size, 2u);
}

TEST(ScriptTextRead, FunctionsAreCode) {
    ScriptVal value;
    ASSERT_TRUE(value.FromText("{ function() return 1 end, print, (function() end) }"));
    const ScriptVal& code = value[1];
    ASSERT_GT(code.ToCodeLen(), 40u);
    EXPECT_EQ(memcmp(code.ToCodePtr(), "\x1bLua\x51\0\1\4\x08\4\x08\0", 12), 0);
    EXPECT_TRUE(value[2].IsCode() && value[2].ToCodeLen() == 0 && code.ToCodeArgs() == 0);
    EXPECT_EQ(Read(Program("return loadstring(string.dump(function() return 5 end))()")), "5");
    EXPECT_EQ(ReadForeign("{ 1, ordered, f = function() end, [tr] = 1 }"), "{1=1}");
    EXPECT_EQ(ReadForeign("ordered"), "nil");
}

TEST(ScriptTextRead, Messages) {
    auto read = [](const char* text, const char* name, int size) {
        ScriptVal value;
        char err[64];
        memset(err, '#', sizeof err);
        strcpy(err, name);
        value.FromText(text, nullptr, err, size, false, 0);
        for (int i = size; i < 64; i++) EXPECT_TRUE(err[i] == '#' || i <= (int)strlen(name));
        return std::string(err);
    };
    EXPECT_EQ(read("'result'", "", 64), "result");
    EXPECT_EQ(read("12.5", "", 64), "12.5");
    EXPECT_EQ(read("'result'", "", 4), "res");
    EXPECT_EQ(read("{}", "name", 64), "");
    EXPECT_EQ(read("}", "", 64), "[string \"FromText\"]:1: unexpected symbol near '}'");
    EXPECT_EQ(read("}", "file.txt", 64), "[string \"file.txt\"]:1: unexpected symbol near '}'");
    EXPECT_EQ(read("}", "@file.txt", 12), "file.txt:1:");
    EXPECT_EQ(read("}", "", 1), "");
    EXPECT_EQ(read("}", "x", 0), "x");
    char unended[4] = {'n', 'a', 'm', 'e'};
    ScriptVal value("old");
    EXPECT_FALSE(value.FromText("}", nullptr, unended, 4, false, 0));
    EXPECT_STREQ(unended, "[st");
    // The text may be the value's own, and none is an empty one.
    value = "{ 5 }";
    EXPECT_TRUE(value.FromText(value.ToString()));
    EXPECT_EQ(Shape(value), "{1=5}");
    EXPECT_TRUE(value.FromText(nullptr) && value.IsNil());
}

TEST(ScriptTextRead, Files) {
    Korvel::Test::TempDir dir;
    ScriptVal value(1);
    char err[300] = "untouched";
    EXPECT_FALSE(value.Load(dir.Path("none").c_str(), err, sizeof err, 0));
    EXPECT_FALSE(value.Load(nullptr, err, sizeof err, 0));
    EXPECT_TRUE(value == 1);
    EXPECT_STREQ(err, "untouched");
    EXPECT_FALSE(value.Load(dir.Path("").c_str(), err, sizeof err, 0));
    const std::string file = dir.Write("settings", "{ 1,\n B { x = ");
    snprintf(err, sizeof err, "@%s", "settings");
    EXPECT_FALSE(value.Load(file.c_str(), err, sizeof err, 0));
    EXPECT_STREQ(err, "settings:2: unexpected symbol near '<eof>'");
    dir.Write("settings", "A { 1, B {} }");
    EXPECT_TRUE(value.Load(file.c_str(), nullptr, 0, 0));
    EXPECT_EQ(Shape(value), "A{1=1 2=B{}}");
}

// The checks are those of the address sanitizer: neither lost nor freed twice.
TEST(ScriptTextRead, FreesItsTextOnEveryWayOut) {
    ScriptVal value;
    for (const char* text : {"{ 1 }", "}", "nil + 1", "newproxy()", ""}) {
        value.FromText(strdup(text), nullptr, nullptr, 0, true, 0);
        value.FromTextByName(strdup(text), "x", nullptr, 0, true, 0);
        value.FromTextByName(strdup(text), "x y", nullptr, 0, true, 0);
    }
    value.FromText(nullptr, nullptr, nullptr, 0, true, 0);
}

TEST(ScriptTextForeign, ReadsWhatOthersWrite) {
    EXPECT_EQ(ReadForeign("ordered() (A.B(1) { z = 1, y = HexData [[ 41 ]], x = tr('t') })"),
              "A.B{'z'=1 'y'=[A] 'x'=__tr{1='t'} '__args'={1=1}}");
    EXPECT_EQ(ReadForeign("{ _Lua 'x', inf, UTF8_ELLIPSIS }"),
              "{1='x' 2={'Name'='inf'} 3='\xE2\x80\xA6'}");
    std::string hosts = "{\n";
    for (int i = 0; i < 1000; i++) hosts += "\t{ Name = \"host\", Address = \"10.0.0.1\" },\n";
    EXPECT_NE(ReadForeign(hosts + "}")[0], '!');
}

// Each of these has to come to an end, quickly, with nothing but a message.
TEST(ScriptTextForeign, HostileTexts) {
    const char* const limits[] = {
        "while true do end",
        "while true do pcall(function() while true do end end) end",
        "local s = 'x' while true do s = s .. s end",
        "local t = {} while true do t = { t, t } end",
        "while true do MemBlock(4e6) end",
        "local t = {} while true do t[#t + 1] = MemBlock(1e5) end",
        "local s = ' 00' for i = 1, 17 do s = s .. s end while true do HexData(s) end",
        "getmetatable(HexData '00').__gc = function() while true do end end collectgarbage()",
        "getmetatable(HexData '00').__gc = function() while true do end end return 1",
        "local t = setmetatable({}, {}) getmetatable(t).__index = function() while true do end "
        "end return pcall(function() return t.x end)",
        // small to tell, huge to copy
        "local t = { 1 } for i = 1, 60 do t = { t, t } end return t",
        "local t = {} for i = 1, 200 do t = { [t] = t } end return t",
        "local s = 'x' for i = 1, 19 do s = s .. s end local t = {} for i = 1, 5000 do t[i] = s "
        "end return t",
        "local m = MemBlock(1e6) local t = {} for i = 1, 5000 do t[i] = m end return t",
        "local s = 'x' for i = 1, 19 do s = s .. s end local t = {} for i = 1, 5000 do "
        "t[i] = { __ctor = s } end return t",
        // long work of one instruction
        "local s = ' ' for i = 1, 17 do s = s .. s end s = s .. '1' while true do "
        "local n = s + 1 end",
        "local s = ' ' for i = 1, 17 do s = s .. s end s = s .. '1' while true do tonumber(s) end",
        "local s = ' ' for i = 1, 17 do s = s .. s end s = s .. '1' while true do "
        "tonumber(s, 16) end",
        "local s = 'x' for i = 1, 17 do s = s .. s end local a, b = s .. 'a', s .. 'b' "
        "while true do local c = a < b end",
    };
    for (const char* body : limits) {
        std::string outcome = ReadForeign(Program(body));
        EXPECT_TRUE(outcome == "! not enough memory" || outcome == "! too many instructions")
            << body << outcome.substr(0, 80);
    }
    const Case cases[] = {
        {Program("local t = {} t.t = t return t"), "! Table nested too deeply."},
        {Program("setmetatable(_parent, { __index = function(t, k) return t[k .. 'x'] end }) "
                 "return zz"),
         "! t:1: C stack overflow"},
        {"\x1bLua", "! t:1: unexpected symbol near 'char(27)'"},
        {"{ load, loadstring, dofile, loadfile, include, newproxy, coroutine, print, string, "
         "table, math, io }",
         ""},
        {"('x'):rep(1e9)", "! t:1: attempt to index a string value"},
        {Program("next, setmetatable, type, rawget = nil return A { x = 1 }"), "A{'x'=1}"},
        {Program("_parent.next = error _parent.type = error return { 1, A { 2 } }"),
         "{1=1 2=A{1=2}}"},
        {Program("return setmetatable({ 1 }, { __index = error, __pairs = error })"), "{1=1}"},
        {Program("local t = {} for i = 1, 100 do t[i] = i end settableflags(t, 0, -1) return "
                 "#t"),
         "100"},
        {Program("local m = HexData '41' getmetatable(m).__index = m return { m }"), "{1=[A]}"},
        {Program("for i = 1, 30 do local m = MemBlock(1e5) end return 1"), "1"},
    };
    for (const Case& c : cases) {
        std::string outcome = ReadForeign(c.text);
        if (!c.outcome.empty()) {
            EXPECT_EQ(outcome, c.outcome) << c.text;
            continue;
        }
        for (int i = 1; i <= 12; i++) {  // each is an unknown name
            EXPECT_NE(outcome.find(std::to_string(i) + "={'Name'="), std::string::npos) << outcome;
        }
    }
}

// Values that the text form holds without loss.
class RandomValues {
public:
    ScriptVal Make(int depth) {
        switch (Pick(depth > 0 ? 8 : 5)) {
            case 0:
                return Pick(2000) - 1000;
            case 1:
                return (Pick(2000000) - 1000000) / 128.0;
            case 2:
                return Pick(2) == 0;
            case 3:
                return Text().c_str();
            case 4: {
                std::string bytes = Text() + std::string("\0\xff", 2);
                return MemBlock(bytes.data(), static_cast<uint32_t>(Pick((int)bytes.size() + 1)));
            }
            default:
                return Table(depth - 1);
        }
    }

    int Pick(int count) { return static_cast<int>(m_Random() % static_cast<unsigned>(count)); }

    bool m_AreOrdered = false;  // all tables

private:
    std::string Text() {
        static constexpr char kLetters[] = "ab_1 \"'\\\n\r\t]]\x01\x80\xc3";
        std::string text;
        for (int i = Pick(12); i > 0; i--) text += kLetters[Pick(sizeof kLetters - 1)];
        return text;
    }
    ScriptVal Number() { return Pick(4) == 0 ? ScriptVal(Pick(40) / 4.0 - 3) : ScriptVal(Pick(6)); }
    ScriptVal Name() {
        static const char* const names[] = {"name", "end", "a b", "", "_", "1a", "Name", "äö"};
        return Pick(2) == 0 ? Text().c_str() : names[Pick(8)];
    }
    // Numbers first: that is how they come back.
    ScriptVal Table(int depth) {
        static const char* const constructors[] = {"A", "A.B_1.C", "odd name", "", "end", "1"};
        ScriptVal table(SV_Table, nullptr);
        for (int i = Pick(5); i > 0; i--) table.FindKey(Number()) = Make(depth);
        for (int i = Pick(6); i > 0; i--) table.FindKey(Name()) = Make(depth);
        if (Pick(3) == 0) table.SetConstructor(constructors[Pick(6)]);
        if (m_AreOrdered || Pick(3) == 0) table.m_Flags |= SVF_Ordered;
        if (Pick(3) == 0) table.m_Flags |= SVF_Compact;
        if (Pick(4) == 0) table.m_Flags |= SVF_ExplicitKeys;
        return table;
    }

    std::mt19937 m_Random{7};
};

// With all that equality leaves out: constructors, order, keys that are written.
std::string OnOneLine(const ScriptVal& value) {
    OxStringT<char> text;
    EXPECT_TRUE(value.ToText(text, 0, TXT_Compact));
    return static_cast<const char*>(text);
}

TEST(ScriptTextRead, ReadsWhatIsWritten) {
    RandomValues values;
    for (int i = 0; i < 3000; i++) {
        values.m_AreOrdered = i % 2 == 0;
        const ScriptVal value = values.Make(4);
        OxStringT<char> text;
        ASSERT_TRUE(value.ToText(text, values.Pick(3) - 1, static_cast<unsigned>(values.Pick(4))));
        ScriptVal read, foreign;
        char err[200] = "";
        ASSERT_TRUE(read.FromText(text, GetSerializePrologue(), err, sizeof err, false, 0))
            << err << static_cast<const char*>(text);
        ASSERT_TRUE(read == value) << Shape(read) << static_cast<const char*>(text);
        if (values.m_AreOrdered) {
            ASSERT_EQ(OnOneLine(read), OnOneLine(value));
        }
        if (text.GetLength() > 3000) continue;  // within the limits for others
        ASSERT_TRUE(FromForeignText(foreign, text, err, sizeof err)) << err;
        ASSERT_TRUE(foreign == value);
    }
}

// A name that is known to a reader, and not to the writer, would be called by the text.
TEST(ScriptTextRead, NoConstructorCallsWhatTheReaderKnows) {
    const char* list =
        "local names = {} for name in pairs(_parent) do names[#names + 1] = name end "
        "names[#names + 1] = '_' names[#names + 1] = '_parent' ";
    ScriptVal names;
    ASSERT_TRUE(names.FromTextByName((std::string(list) + "all = names").c_str(), "all", nullptr, 0,
                                     false, 0));
    ScriptVal more;
    ASSERT_TRUE(more.FromText((std::string(list) + "return names").c_str(), "local _parent = _G ",
                              nullptr, 0, false, 0));
    ASSERT_GT(more.NumKeys(), 40u);
    // What a prologue's record answers to by itself.
    ScriptVal fields;
    ASSERT_TRUE(fields.FromText("{ 'A.Name', 'A.B.Name.C', 'A.name', 'A.Args', 'Name', 'name' }"));
    for (const ScriptVal* known : {&names, &more, &fields}) {
        for (unsigned int i = 1; i <= known->NumKeys(); i++) {
            ScriptVal value(SV_Table, nullptr);
            value.SetConstructor(known->FindKeyConst(i).ToString());
            value["x"] = 1;
            OxStringT<char> text;
            ScriptVal read;
            ASSERT_TRUE(value.ToText(text, 0, 0) && read.FromText(text)) << text;
            EXPECT_EQ(Shape(read), Shape(value)) << text;
            const std::string byName = std::string("x = ") + static_cast<const char*>(text);
            EXPECT_EQ(ReadByName(byName, "x"), Shape(value)) << text;
        }
    }
}

TEST(ScriptTextRead, ReadersRunSideBySide) {
    std::atomic<int> failures{0};
    auto read = [&failures] {
        for (int i = 0; i < 50; i++) {
            ScriptVal own, foreign;
            bool isRead = own.FromText("ordered() (A(1) { b = HexData [[ 41 ]], a = tr 'x' })") &&
                          FromForeignText(foreign, "A { b = HexData [[ 41 ]] }", nullptr, 0);
            if (!isRead || Shape(own) != "A{'b'=[A] 'a'=__tr{1='x'} '__args'={1=1}}") failures++;
        }
    };
    std::thread other(read);
    read();
    other.join();
    EXPECT_EQ(failures, 0);
}

#ifdef KORVEL_FAULTS
TEST(ScriptTextRead, WithoutMemoryItFailsWithAMessage) {
    const char* const text =
        "ordered() (A.B(1) { z = 1, y = HexData [[ 41 ]], x = tr 't', f = function() end, "
        "{ 'a', 'b\\0' }, __flags = 256 })";
    int failures = 0;
    for (unsigned n = 1, failed = 1; failed; n++) {
        failed = 0;
        for (bool forGood : {true, false}) {
            ScriptVal value(1);
            char err[100] = "=t";
            char* copy = strdup(text);
            Faults::FailAt(n, forGood);
            bool isRead = value.FromText(copy, GetSerializePrologue(), err, sizeof err, true, 0);
            Faults::Stop();
            if (isRead) {
                EXPECT_EQ(Shape(value), Read(text)) << n;
            } else {
                failed++;
                EXPECT_STREQ(err, "not enough memory") << n;
            }
        }
        failures += static_cast<int>(failed);
    }
    EXPECT_GT(failures, 20);
}
#endif

}  // namespace

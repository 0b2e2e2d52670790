// What the distribution's interpreter cannot show: the dialect's own additions, limits, chunks and
// the life of an interpreter.
#include <gtest/gtest.h>

#include <cstdint>
#include <random>
#include <string>

#include "textform/Chunk.h"
#include "textform/Interpreter.h"

namespace {

using namespace Korvel::TextForm;

void OpenAll(State& L) {
    OpenBase(L);
    OpenString(L);
    OpenTable(L);
    OpenMath(L);
}

// Runs a chunk; its result or message as text.
std::string RunText(Interpreter& interpreter, const std::string& text) {
    State& L = interpreter.GetState();
    L.SetTop(0);
    Status status = L.LoadBuffer(text, "=t");
    if (status == Status::Ok) status = L.ProtectedCall(0, 1);
    std::string prefix = status == Status::Ok ? "" : "! ";
    if (L.m_Top[-1].Is(Type::Boolean)) return L.m_Top[-1].m_Boolean ? "true" : "false";
    if (!L.ToString(L.m_Top - 1)) return prefix + GetTypeName(L.m_Top[-1].m_Type);
    return prefix.append(L.m_Top[-1].AsString()->GetView());
}

std::string RunText(const std::string& text) {
    Interpreter interpreter;
    OpenAll(interpreter.GetState());
    return RunText(interpreter, text);
}

TEST(TextFormDialect, Tables) {
    const char* keys =
        "local function keys(t) local s = '' for k in pairs(t) do s = s .. tostring(k) .. ' ' end "
        "return s end local flags = gettableflags ";
    struct Case {
        const char* text;
        const char* result;
    };
    const Case cases[] = {
        {"sethashstate(0) return keys{ z = 1, y = 2, x = 3 }", "z y x "},
        {"sethashstate(0) local t = {} for i = 100, 1, -1 do t['k' .. i] = i end "
         "local n = 100 for k in pairs(t) do if k ~= 'k' .. n then return k end n = n - 1 end "
         "return n .. t.k50",
         "050"},  // through several rehashes
        {"sethashstate(0) local t = { b = 1, [2.5] = 2, [true] = 3, a = 4 } t.b = nil t.c = 5 "
         "return keys(t) .. t[2.5] .. t.a .. tostring(t.q)",
         "c 2.5 true a 24nil"},  // a free place is taken again
        {"sethashstate(0) sethashstate(0) local f = function() end local a, b = {}, {} "
         "return flags(a) .. flags(b)",
         "01"},
        {"sethashstate(256) local a = {} sethashstate('x') local b = {} sethashstate(257) "
         "return flags(a) .. flags(b) .. flags({})",
         "001"},
        {"sethashstate(0) local function f(...) return flags(arg) end return f()", "0"},
        {"local t sethashstate(0) coroutine.wrap(function() t = {} end)() return flags(t) .. "
         "flags({})",
         "10"},  // each thread has its own
        {"return flags{ 1, 2 } .. flags{ a = 1 } .. flags{} .. flags{\n1} .. flags{\na = 1}",
         "75131"},
        {"return flags{ a = 1,\nb = 2 } .. flags{ a = 1\n, b = 2 } .. flags{ a = 1\n}", "511"},
        {"local function f() end return flags{ f() } .. flags{\nf() } .. flags{ 1, f() }", "737"},
        {"local t = { 1 } settableflags(t, 0, 255) local a = flags(t) t.x = 1 "
         "settableflags(t, '257', 4294967295) return a .. ' ' .. flags(t) .. t.x",
         "0 2561"},  // with keys in place, bit 0 stays
        {"local t = {} settableflags(t, {}, 1) return flags(t)", "0"},
        {"local t = {} settableflags(t, 0) return flags(t)", "1"},
        {"return gettableflags(1)",
         "! t:1: bad argument #1 to 'gettableflags' (table expected, got number)"},
        {"settableflags()",
         "! t:1: bad argument #1 to 'settableflags' (table expected, got no value)"},
        {"local s = '' for k, v in { 5, a = 1 } do s = s .. k .. v end return s", "15a1"},
        {"local t = setmetatable({ 7 }, { __call = error }) for k, v in t do return v end", "7"},
        {"next = nil for k in {} do end", "! t:1: attempt to call a nil value"},
        {"return '\\x41\\x7A\\x00b' == 'Az\\0b'", "true"},
        {"return '\\x4'", "! t:1: hexadecimal digit expected near ''\\x4'"},
        {"return '\\xg0'", "! t:1: hexadecimal digit expected near ''\\xg'"},
    };
    for (const Case& c : cases) {
        std::string result = RunText(std::string(keys) + c.text);
        if (std::string(c.result).find("hexadecimal") != std::string::npos) {
            EXPECT_NE(result.find("hexadecimal digit expected"), std::string::npos) << result;
        } else {
            EXPECT_EQ(result, c.result) << c.text;
        }
    }
}

TEST(TextFormDialect, ConstantsBeyondTheirField) {
    std::string text = "local t = {\n";
    for (int i = 0; i < 270000; i++) {
        text.append("'c").append(std::to_string(i)).append("',\n");
    }
    text.append(
        "}\nlateglobal = 'last' for i = 1, 3 do lateglobal = lateglobal .. i end\n"
        "for i = 1, 270000 do if t[i] ~= 'c' .. i - 1 then return i end end\n"
        "return lateglobal");
    Interpreter interpreter;
    OpenAll(interpreter.GetState());
    EXPECT_EQ(RunText(interpreter, text), "last123");
    // the name of a global is found, too
    std::string failing = text.substr(0, text.rfind("return")) + "return lateglobal.x.y";
    EXPECT_NE(RunText(interpreter, failing).find("attempt to index field '?' (a nil value)"),
              std::string::npos);
    failing = text.substr(0, text.rfind("return")) + "return lateunknown.x";
    EXPECT_NE(RunText(interpreter, failing).find("attempt to index global 'lateunknown'"),
              std::string::npos);
}

std::string RunLimited(const std::string& text) {
    Interpreter interpreter(Limits{100000, 4 << 20});
    State& L = interpreter.GetState();
    Status status = L.RunProtected([&] { OpenBase(L, BaseLevel::Foreign); }, L.m_Top, 0);
    return status == Status::Ok ? RunText(interpreter, text) : "no library";
}

TEST(TextFormLimits, NothingGetsAround) {
    const char* const tooLong[] = {
        "while true do end",
        "for i = 1, 1e9 do end",
        "pcall(function() while true do end end) return 1",
        "while true do pcall(function() while true do end end) end",
        "xpcall(function() while true do end end, function() while true do end end) return 1",
        "local function f() return f() end f()",
        "for k in pairs(setmetatable({}, {})) do end local t = setmetatable({}, {}) "
        "getmetatable(t).__index = function() while true do end end return pcall(function() "
        "return t.x end)",
        "while true do collectgarbage() end",
        "sethashstate(0) local t = {} for i = 1, 20000 do t[i .. ''] = i end",
        "local s = 'x' for i = 1, 18 do s = s .. s end while true do local a = s .. 'y' end",
        "local t = {} for i = 1, 7000 do t[i] = i end while true do unpack(t) end",
        "local t = {} for i = 1, 20000 do t[i .. ''] = 1 end for k in pairs(t) do t[k] = nil end "
        "while true do next(t) end",
        "local s = '1' for i = 1, 19 do s = s .. s end while true do local n = s + 0 end",
        "local s = 'x' for i = 1, 19 do s = s .. s end local a, b = s .. 'a', s .. 'b' "
        "while true do local less = a < b end",
        "collectgarbage('setpause', 0) collectgarbage('setstepmul', 0) local t = {} "
        "for i = 1, 20000 do t[i] = {} end while true do local x = {} end",
        "while true do collectgarbage('step', 1e6) end",
        "local function f(...) return f(...) end local t = {} for i = 1, 7000 do t[i] = i end "
        "f(unpack(t))",
    };
    for (const char* text : tooLong) EXPECT_EQ(RunLimited(text), "! too many instructions") << text;
    const char* const tooMuch[] = {
        "local s = 'x' while true do s = s .. s end",
        "local s = 'x' while true do pcall(function() s = s .. s end) end",
        "local t = {} local n = 0 while true do n = n + 1 t[n] = {n, n, n, n, n, n, n, n} end",
        "local function f() return 1 + f() end while true do pcall(f) end",
    };
    for (const char* text : tooMuch) {
        std::string result = RunLimited(text);
        EXPECT_TRUE(result == "! not enough memory" || result == "! too many instructions")
            << text << result;
    }
    const char* const absent[] = {"load",      "loadstring", "loadfile", "dofile", "newproxy",
                                  "coroutine", "string",     "table",    "math",   "include"};
    for (const char* name : absent) {
        EXPECT_EQ(RunLimited(std::string("return ") + name), "nil") << name;
    }
    EXPECT_EQ(RunLimited("return ('x').len"), "! t:1: attempt to index a string value");
    EXPECT_EQ(RunLimited("local t = {} for i = 1, 1000 do t[i] = i .. '' end return #t"), "1000");
}

// Keys that were chosen to have one hash, jumps that make one list, names that are sought in many
// scopes: each step is short, all together would take minutes.
TEST(TextFormLimits, WorkThatIsNoInstructionCounts) {
    std::string keys = "return {";
    for (int i = 0; i < 20000; i++) {  // only every second character counts in the hash of these
        std::string key(40, 'k');
        for (int bit = 0; bit < 15; bit++) key[8 + 2 * bit] = i >> bit & 1 ? 'a' : 'b';
        keys.append("'").append(key).append("',");
    }
    EXPECT_EQ(RunLimited(keys + "}"), "! too many instructions");
    std::string jumps = "return a";
    for (int i = 0; i < 20000; i++) jumps += " or a";
    EXPECT_EQ(RunLimited(jumps), "! too many instructions");
}

TEST(TextFormLimits, TextOfAnySizeFailsInItsOwnWay) {
    std::string deep(100000, '{');
    EXPECT_EQ(RunText("return " + deep).find("! t:1: chunk has too many syntax levels"), 0u);
    EXPECT_EQ(RunLimited("return '" + std::string(5 << 20, 'x') + "'"), "! not enough memory");
}

// Every failing allocation leaves a machine that can be closed, and goes on where it can.
TEST(TextFormLimits, MemoryRunsOutAnywhere) {
    const std::string text =
        "local t = {} for i = 1, 50 do t[i] = { name = 'n' .. i, f = function() return t end } end "
        "local co = coroutine.wrap(function(...) coroutine.yield(#t) error({}) end) co() "
        "pcall(co) local p = newproxy(true) getmetatable(p).__gc = function() t = nil end "
        "return (('a b c'):gsub('%w', '%0%0')) .. loadstring(string.dump(function(...) local a = "
        "{...} return #a end))(1, 2)";
    int failures = 0;
    for (size_t limit = 20000; limit < 200000; limit += 173) {
        Interpreter interpreter;
        State& L = interpreter.GetState();
        interpreter.GetMachine().m_Heap.SetLimit(limit);
        Status status = L.RunProtected([&] { OpenAll(L); }, L.m_Top, 0);
        std::string result =
            status == Status::Ok ? RunText(interpreter, text) : "! not enough memory";
        if (result == "aa bb cc2") continue;
        failures++;
        EXPECT_NE(result.find("not enough memory"), std::string::npos) << limit << result;
    }
    EXPECT_GT(failures, 50);
}

TEST(TextFormLife, StacksGiveMemoryBack) {
    EXPECT_EQ(
        RunText("local function deep(n) if n > 0 then return 1 + deep(n - 1) end return 0 end "
                "collectgarbage() local before = collectgarbage('count') deep(15000) "
                "for i = 1, 20 do collectgarbage() end "
                "return collectgarbage('count') - before < 20"),
        "true");
}

// The number of the last part of a long list looks like any instruction.
TEST(TextFormDialect, LongListsBeforeJumps) {
    for (int count : {26950, 26949, 50 * 535, 50 * 599}) {
        std::string list = "{";
        for (int i = 0; i < count; i++) list += "1,";
        std::string text = "while true do t = " + list;
        text.append("} break end local u = ").append(list).append("} or 5 return #t + #u");
        EXPECT_EQ(RunText(text), std::to_string(2 * count));
    }
}

TEST(TextFormLife, FinalisersRunWhenItEnds) {
    static int s_Calls;
    s_Calls = 0;
    {
        Interpreter interpreter;
        State& L = interpreter.GetState();
        OpenAll(L);
        L.PushFunction([](State&) { return s_Calls++, 0; });
        L.SetField(L.m_Globals, "count", L.m_Top[-1]);
        EXPECT_EQ(
            RunText(interpreter,
                    "local function p(f) local u = newproxy(true) getmetatable(u).__gc = f "
                    "return u end a = p(count) b = p(function() error('x') end) c = p(count) "
                    "d = p(function() p(count) end) local function more() p(more) error('x') end "
                    "e = p(more) return 1"),
            "1");
        EXPECT_EQ(s_Calls, 0);
    }
    EXPECT_GE(s_Calls, 2);
}

// Chunks with words changed are refused, or run without harm.
TEST(TextFormChunks, ChangedOnesDoNoHarm) {
    std::string good = RunText(
        "return string.dump(function(a, ...) local t = { 1, 2, x = a, ... } "
        "for i = 1, 3 do t[i] = function() return t, i end end for k, v in pairs(t) do "
        "if k == 1 and v or a then break end end return #t .. 'x', t.x:y(a) end)");
    ASSERT_EQ(good.size() > 200, true);
    Interpreter fresh;
    OpenAll(fresh.GetState());
    EXPECT_EQ(fresh.GetState().LoadBuffer(good, "=c"), Status::Ok);
    EXPECT_EQ(fresh.GetState().LoadBuffer(good, "=c", false), Status::RunError);
    for (size_t size = 1; size < good.size(); size++) {
        EXPECT_NE(fresh.GetState().LoadBuffer(good.substr(0, size), "=c"), Status::Ok) << size;
        fresh.GetState().SetTop(0);
    }
    std::mt19937 random(1);
    for (int i = 0; i < 3000; i++) {
        std::string bad = good;
        for (unsigned n = random() % 3 + 1; n > 0; n--) {
            bad[12 + random() % (bad.size() - 12)] = static_cast<char>(random());
        }
        Interpreter interpreter(Limits{20000, 4 << 20});
        State& L = interpreter.GetState();
        OpenBase(L);
        if (L.LoadBuffer(bad, "=c") == Status::Ok) L.ProtectedCall(0, 1);
    }
}

}  // namespace

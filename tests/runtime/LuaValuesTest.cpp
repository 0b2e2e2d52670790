#include "runtime/lua/LuaValues.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>
#include <cstring>
#include <lua.hpp>
#include <stdexcept>
#include <string>
#include <vector>

#include "core/FaultsInternal.h"
#include "diag/Env.h"
#include "objects/ScriptConfig.h"
#include "runtime/lua/KRScriptLibInternal.h"

namespace Korvel {
namespace {

// What the scripts of the tests use.
const char* const kPrelude = R"lua(
    function ordered(keys)
        local t = table.ordered()
        for i, key in ipairs(keys) do t[key] = i end
        return t
    end
    function bytes(block)
        local t = {}
        for i = 1, block.Size do t[i] = string.char(block[i]) end
        return table.concat(t)
    end
    function same(a, b)  -- a block is the same as the string it comes from
        if type(a) == "userdata" then a = bytes(a) end
        if type(b) == "userdata" then b = bytes(b) end
        if type(a) ~= "table" or type(b) ~= "table" then return a == b end
        for k, v in pairs(a) do if not same(v, b[k]) then return false end end
        for k in pairs(b) do if a[k] == nil then return false end end
        return true
    end
    function nested(depth)
        local t = {}
        for i = 2, depth do t = {[i % 2 == 0 and "t" or 1] = t} end
        return t
    end
)lua";

ToLuaFunc s_ToLua = nullptr;
FromLuaFunc s_FromLua = nullptr;

// convert(value, isConsumed): to native code and back.
int Convert(lua_State* L) {
    ScriptVal value;
    int top = lua_gettop(L);
    EXPECT_TRUE(FromLua(L, 1, value, s_FromLua, nullptr, lua_toboolean(L, 2)));
    EXPECT_EQ(lua_gettop(L), top);
    bool isPushed = ToLua(nullptr, L, value, s_ToLua, nullptr, 0);
    EXPECT_EQ(lua_gettop(L), top + isPushed);
    return isPushed;
}

// send(value): to another process and back.
int Send(lua_State* L) {
    ScriptVal value, received;
    EXPECT_TRUE(FromLua(L, 1, value, nullptr, nullptr, 0));
    std::vector<unsigned char> bytes(value.CalcPktSize());
    unsigned char* cursor = bytes.data();
    EXPECT_TRUE(value.ToPkt(nullptr, cursor));
    cursor = bytes.data();
    EXPECT_TRUE(received.FromPkt(nullptr, cursor, bytes.data() + bytes.size()));
    EXPECT_TRUE(received == value);
    return ToLua(nullptr, L, received, nullptr, nullptr, 0);
}

// The keys of a value in their order, and "!" behind them if it is ordered.
int Keys(lua_State* L) {
    ScriptVal value;
    lua_toscriptval(L, 1, value);
    std::string keys;
    for (TableEntry* entry = nullptr; value.NextKey(entry);) {
        const ScriptVal& key = entry->m_Key;
        keys += key.IsNumber() ? std::to_string(key.ToInteger()) : key.ToString("?");
        keys += ' ';
    }
    if (value.m_Flags & SVF_Ordered) keys += '!';
    lua_pushstring(L, keys.c_str());
    return 1;
}

class LuaValuesTest : public testing::Test {
protected:
    LuaValuesTest() {
        luaL_openlibs(m_Lua);
        register_memblock(m_Lua);
        lua_register(m_Lua, "convert", Convert);
        lua_register(m_Lua, "send", Send);
        lua_register(m_Lua, "keys", Keys);
        RunOrderedTableScript(m_Lua);
        EXPECT_EQ(Run(kPrelude), "");
    }
    ~LuaValuesTest() override { lua_close(m_Lua); }

    // The error of a script, or what it returns as a text.
    std::string Run(const std::string& text) {
        bool isRun = luaL_loadbuffer(m_Lua, text.data(), text.size(), "=test") == 0 &&
                     lua_pcall(m_Lua, 0, 1, 0) == 0;
        const char* result = lua_isboolean(m_Lua, -1)
                                 ? (lua_toboolean(m_Lua, -1) ? "true" : "false")
                                 : lua_tostring(m_Lua, -1);
        std::string said = (isRun ? "" : "error: ") + std::string(result ? result : "");
        lua_settop(m_Lua, 0);
        return said;
    }

    struct Case {
        const char* m_Script;  // returns the result
        const char* m_Result;
    };
    template <size_t N>
    void Check(const Case (&cases)[N]) {
        for (const Case& c : cases) EXPECT_EQ(Run(c.m_Script), c.m_Result) << c.m_Script;
    }

    lua_State* m_Lua = luaL_newstate();
};

constexpr char kUnsupported[] = "error: Unsupported type for custom data!";

TEST_F(LuaValuesTest, WhatComesBack) {
    const Case cases[] = {
        {"return keys{[3]=1, [1]=1, x=1, [2]=1}", "1 2 3 x "},
        {"return keys{[-1]=0, [-3]=0, [2^60]=0, y=0}", "-3 -1 1152921504606846976 y "},
        {"return next(convert{[{5}]=1})[1]", "5"},
        {"return bytes(next(convert{['a\\0']=1})) == 'a\\0'", "true"},
        {"return convert{f=print}.f", ""},
        {"return same(nested(256), convert(nested(256)))", "true"},
        {"return convert(nested(257))", "error: Table nested too deeply."},
        {"return convert(io.stdout)", kUnsupported},
        {"return convert(newproxy(true))", kUnsupported},
        {"return convert{{coroutine.create(print)}}", kUnsupported},
        {"return convert(require('ffi').new('int[2]'))", kUnsupported},
        {"return convert{['\\255']=1}", kUnsupported},
        // Attributes make no entries. Flags lose the byte of the type, and read-only.
        {"return keys{__ctor='Point', __flags=256, a=1}", "a "},
        {"return keys{__ctor=5, __flags='x', ['__ctor\\0']=1}", "? "},
        {"return convert{__ctor='Point'}.__ctor", "Point"},
        {"return convert{__ctor='\\255'}", kUnsupported},
        {"return convert{__ctor='a\\0'}", kUnsupported},
        {"c = {__ctor=('x'):rep(1e6)} t = {} for i = 1, 300 do t[i] = c end return convert(t)",
         "error: Table nested too deeply."},
        {"return convert{__flags=0x500304}.__flags == 0x500100", "true"},
        {"return same(convert{__flags=0x100200, {7}}, {{7}})", "true"},
        {"return same(convert{__flags=0/0}, convert{__flags=-1e300})", "true"},
    };
    Check(cases);
}

TEST_F(LuaValuesTest, OrderedTables) {
    const Case cases[] = {
        {"return keys(ordered{'b', 2, 'a', 1})", "1 2 b a !"},
        {"return keys(convert({ordered{'b', 'a'}}, true)[1])", "b a !"},
        {"t = ordered{'a', 1} convert(t, true) return rawget(t, 'a') == nil and keys(t)", "!"},
        {"t = ordered{'z'} t.__ctor = 'P' return keys(t) .. convert(t).__ctor", "z !P"},
        {"t = ordered{'z'} t.__flags = 256 return keys(t)", "z "},
        // Entries under the names of its fields do no harm to its order.
        {"t = convert{__flags=0x200000, __keytoidx=5, __idxtokey={'x'}, x=1}"
         " return keys(t) .. type(t.__keytoidx)",
         "x !table"},
        // An iterator that takes a key out from under the walk over a table further out.
        {R"(outer = {}
            for i = 1, 100 do outer['a' .. i] = ordered{'x'} end
            local step = _orderedtable_next
            _orderedtable_next = function(t, k)
                for key in pairs(outer) do outer[key] = nil end
                for i = 1, 1000 do outer[i] = i end
                return step(t, k)
            end
            local isDone, message = pcall(convert, outer)
            _orderedtable_next = step
            return isDone and type(message) or message)",
         "table"},
        // Nothing to make one, what fails, and what makes no table: plain ones with their flag.
        {R"(t = ordered{'a'}
            for _, f in ipairs{false, error, type, function() return 1 end} do
                table.ordered = f
                local plain = convert(t)
                if getmetatable(plain) or not plain.a or plain.__flags ~= 0x200000 then return f end
            end
            table = nil
            return convert(t).a)",
         "1"},
        // Globals that raise are not asked, and an iterator that does ends the table.
        {R"(_orderedtable_meta = nil
            setmetatable(_G, {__index = error})
            return keys{1} .. keys(setmetatable({2}, {})))",
         "1 1 "},
        {R"(_orderedtable_meta, _orderedtable_next = {}, error
            return keys(setmetatable({1}, _orderedtable_meta)))",
         "!"},
    };
    Check(cases);
}

// Keys that make no entries use up the limit too, or such a walk would go on for ever.
TEST_F(LuaValuesTest, EndlessOrder) {
    auto setLimit = [](const char* mib) {
        setenv("KORVEL_MaxPacketSize", mib, 1);
        EnvVar::InvalidateEnv();
    };
    setLimit("1");
    for (std::string name : {"__flags", "__ctor", "x"}) {
        Run("name = '" + name + "'");
        EXPECT_EQ(Run("t = table.ordered() t.__idxtokey = {name} t.__keytoidx = {[name] = 0}"
                      " rawset(t, name, 0) return convert(t)"),
                  "error: Table nested too deeply.");
    }
    setLimit("256");
}

// What a conversion may not change comes back, and what it takes from a table is gone from there.
TEST_F(LuaValuesTest, RandomTables) {
    const char* script = R"lua(
        math.randomseed(7)
        local random = math.random
        local function text(alphabet)
            return (("x"):rep(random(0, 9)):gsub(".", function()
                local i = random(#alphabet)
                return alphabet:sub(i, i)
            end))
        end
        local keys = {
            function() return random(-3, 20) end, function() return random() * 10 - 5 end,
            function() return random(2) == 1 end, function() return text("abc") end,
        }
        local function value(depth)
            local kind = random(depth > 5 and 3 or 5)
            if kind == 1 then return random(-1e9, 1e9) / 8 end
            if kind == 2 then return random(2) == 1 end
            if kind == 3 then return text("abc\0\255") end
            local t = {}
            for i = 1, random(0, 8) do t[random(2) == 1 and #t + 1 or keys[random(4)]()] = value(depth + 1) end
            return t
        end
        for i = 1, 1000 do
            local v = {value(0), x = value(0)}
            local copy = convert(v)
            if not same(v, copy) then return "another" end
            if not same(v, send(v)) then return "another when sent" end
            if not same(convert(v, true), copy) then return "another when consumed" end
            if next(v) ~= nil then return "not consumed" end
        end
        return "same"
    )lua";
    EXPECT_EQ(Run(script), "same");
}

TEST_F(LuaValuesTest, ValuesThatLuaCannotHold) {
    uint64_t word = 1;
    ScriptVal table;
    table = SV_Table;
    ScriptVal pointer(SV_Pointer, &word);
    EXPECT_FALSE(lua_pushscriptval(m_Lua, pointer));
    table[pointer] = 1;
    table["pointer"] = pointer;
    table[ScriptVal()] = 2;
    table[NAN] = 3;
    table["nil"] = SV_Nil;
    table[0.5] = 4;
    EXPECT_TRUE(lua_pushscriptval(m_Lua, table));
    EXPECT_EQ(lua_gettop(m_Lua), 1);
    lua_setglobal(m_Lua, "v");
    EXPECT_EQ(Run("local k, x = next(v) return k .. x .. tostring(next(v, k))"), "0.54nil");

    auto push = [](lua_State* L) {
        auto* value = static_cast<ScriptVal*>(lua_touserdata(L, 1));
        return static_cast<int>(lua_pushscriptval(L, *value));
    };
    ScriptVal deep;
    ScriptVal* inner = &deep;
    for (int i = 0; i <= kMaxNesting; i++, inner = &(*inner)[1]) *inner = SV_Table;
    EXPECT_EQ(lua_cpcall(m_Lua, push, &deep[1]), 0);
    EXPECT_NE(lua_cpcall(m_Lua, push, &deep), 0);
    EXPECT_STREQ(lua_tostring(m_Lua, -1), "Table nested too deeply.");
}

TEST_F(LuaValuesTest, Results) {
    struct ResultCase {
        std::vector<double> m_Keys;     // each holds itself
        std::vector<double> m_Results;  // 0 for nil
    };
    const ResultCase cases[] = {
        {{0, 1, 2}, {}},
        {{-3, -1, 0, 5}, {-1, 0, -3}},
        {{-2.5, -256, -1e300, -INFINITY, NAN, -1}, {-1, 0}},
    };
    for (const ResultCase& c : cases) {
        ScriptArgs args;
        for (double key : c.m_Keys) args[key] = key;
        lua_settop(m_Lua, 0);
        std::vector<double> results(ToLuaRet(nullptr, m_Lua, args, nullptr, nullptr, 0));
        for (int i = 0; i < lua_gettop(m_Lua); i++) results.at(i) = lua_tonumber(m_Lua, i + 1);
        EXPECT_EQ(results, c.m_Results);
    }
    ScriptArgs many;
    many[-255] = 255;
    EXPECT_EQ(ToLuaRet(nullptr, m_Lua, many, nullptr, nullptr, 0), 255);
    EXPECT_EQ(lua_tonumber(m_Lua, -1), 255);
    EXPECT_EQ(ToLuaRet(nullptr, m_Lua, many[-255], nullptr, nullptr, 0), 0);
}

TEST_F(LuaValuesTest, Code) {
    OxID error;
    EXPECT_EQ(lua_StrToCode("return return", error, nullptr), nullptr);
    EXPECT_NE(strstr(error, "unexpected symbol near 'return'"), nullptr);
    EXPECT_EQ(lua_FileToCode("/no/such/file.lua", error, nullptr), nullptr);
    EXPECT_NE(strstr(error, "cannot open"), nullptr);
    MemBlock* block = lua_StrToCode("return 'one', 2, nil", error, nullptr);
    ASSERT_NE(block, nullptr);
    ScriptVal code(block->m_Ptr, block->m_Size, 0);
    g_ReusePoolMgr.Free(block->m_Ptr);
    g_ReusePoolMgr.Free(block);

    // All results at the top, exactly one of those inside, none for what fails.
    EXPECT_TRUE(lua_pushscriptval(m_Lua, code));
    EXPECT_EQ(lua_gettop(m_Lua), 3);
    ScriptArgs args;
    args[-1] = code;
    args[-2] = ScriptVal("error({})", 9, 0);
    args[-3] = ScriptVal("return nothing, 4", 17, 0);
    args[-4] = ScriptVal("=", 1, 0);
    EXPECT_EQ(Run("function _ALERT(text) told = (told or '') .. (type(text) == 'string' and text "
                  "or type(text)) .. ';' end"),
              "");
    EXPECT_EQ(ToLuaRet(nullptr, m_Lua, args, nullptr, nullptr, 0), 4);
    EXPECT_EQ(lua_gettop(m_Lua), 4);
    EXPECT_STREQ(lua_tostring(m_Lua, 1), "one");
    for (int i = 2; i <= 4; i++) EXPECT_TRUE(lua_isnil(m_Lua, i));
    EXPECT_EQ(Run("return told"), "table;[string \"<code>\"]:1: unexpected symbol near '=';");
}

// The callbacks make "UP" of "up" in keys and values, and leave rubbish on the stack.
TEST_F(LuaValuesTest, Callbacks) {
    auto write = [](RemoteApp*, lua_State* L, ScriptVal& value, void*, auto...) {
        if (value == "bad value") throw std::runtime_error("cannot write");
        for (int i = 0; i < 15; i++) lua_pushliteral(L, "UP");
        return value == "up";
    };
    auto read = [](lua_State* L, int index, ScriptVal& value, void*, auto...) {
        std::string text = lua_type(L, index) == LUA_TSTRING ? lua_tostring(L, index) : "";
        if (text == "bad text") throw std::runtime_error("cannot read");
        for (int i = 0; i < 15; i++) lua_pushliteral(L, "rubbish");
        if (text == "down") value = "up";
        return text == "down";
    };
    ScriptConfig config;
    config.ToLua = write;
    config.FromLua = read;
    const Case cases[] = {
        {"v = convert{down='up', {'down'}} return v.UP .. v[1][1]", "UPUP"},
        {"return convert{{'bad text'}}", "error: cannot read"},
        {"return convert{{'bad value'}}", "error: cannot write"},
    };
    g_ScriptConfig = &config;
    Check(cases);
    g_ScriptConfig = nullptr;
    s_ToLua = write;
    s_FromLua = read;
    Check(cases);
    s_ToLua = nullptr;
    s_FromLua = nullptr;
}

TEST_F(LuaValuesTest, BlocksOfBytes) {
    const Case cases[] = {
        {"return select('#', MemBlock(0), nil) + select('#', MemBlock(0))", "2"},
        {"return #{MemBlock(0/0), MemBlock(2^32), MemBlock('4'), MemBlock(), HexData(12)}", "0"},
        {"b = MemBlock(4) return b[1] .. b[4] .. tostring(b[5]) .. tostring(b[0])", "00nilnil"},
        {"return b.Size .. tostring(b.size) .. tostring(b['1']) .. tostring(b)",
         "4nilnilMemBlock (4 bytes)"},
        {"b[0] = 1 b[5] = 1 b[1] = 300 b[2] = -1 b[3] = '7' b[4.5] = 8 return bytes(b) =="
         " '\\44\\255\\0\\0'",
         "true"},
        {"return bytes(HexData(' 1 fF\\n1ff 0x10 -1\\t7zz 8')) == '\\1\\255\\255\\16\\255\\7'",
         "true"},
        {"return bytes(HexData('12-3 4')) .. bytes(HexData('+1 2'))", "\x12\x01\x02"},
        {"return tostring(HexData('')) .. tostring(convert(HexData('zz')))",
         "MemBlock (0 bytes)MemBlock (0 bytes)"},
        // Metamethods in the hands of a script.
        {"m = getmetatable(b) m.__gc(b) m.__gc(b) return b[1] or b.Size or 'gone'", "gone"},
        {"return convert(b)", kUnsupported},
        {"b[1] = 1 return m.__tostring(b)", ""},
        {"for _, x in ipairs{1, {}, io.stdout, newproxy(true)} do for _, f in pairs(m) do"
         " if type(f) == 'function' then f(x, 1, 1) f() end end end return 'calm'",
         "calm"},
        {"p = newproxy(true) debug.setmetatable(p, m) x = p[1] debug.setmetatable(p, nil)"
         " return x",
         ""},
        // The collector keeps up with blocks that are dropped.
        {"live = setmetatable({}, {__mode='k'}) for i = 1, 1000 do live[MemBlock(2^16)] = 1 end"
         " n = 0 for _ in pairs(live) do n = n + 1 end return n < 100 or n",
         "true"},
    };
    Check(cases);
}

// Whichever allocation of a conversion fails, Lua's or ours: nothing is lost and no pointer left.
TEST(LuaValues, FailingAllocations) {
    auto allocate = [](void*, void* old, size_t oldSize, size_t size) -> void* {
        if (size == 0) return free(old), nullptr;
        if (size > oldSize) return realloc(old, size);
        Faults::Uncounted shrinking;
        return realloc(old, size);
    };
    auto convert = [](lua_State* L) {
        auto* value = static_cast<ScriptVal*>(lua_touserdata(L, 1));
        lua_getglobal(L, "source");
        if (!FromLua(L, -1, *value, nullptr, nullptr, 0)) luaL_error(L, "no memory");
        lua_pushscriptval(L, *value);
        return 0;
    };
    unsigned n = 0;
    for (bool hasFailed = true; hasFailed;) {
        lua_State* L = lua_newstate(allocate, nullptr);
        luaL_openlibs(L);
        register_memblock(L);
        const char* source =
            "source = ordered{'a', 'bc', 3, 1}\n"
            "source.block = HexData(('1 '):rep(2000))\n"
            "source.x = {__ctor='P', __flags=256, x=1, 'text', 'nul\\0', [{}]={1}}\n"
            "source.f = function(...) return ..., 1.5 end";
        RunOrderedTableScript(L);
        ASSERT_EQ(luaL_dostring(L, kPrelude) || luaL_dostring(L, source), 0);
        ScriptVal value;
        Faults::FailAt(++n, false);
        int error = lua_cpcall(L, convert, &value);
        hasFailed = Faults::Stop() >= n;
        EXPECT_TRUE(hasFailed || !error) << "an error without a failure";
        lua_close(L);
    }
    EXPECT_GT(n, 40u);
}

}  // namespace
}  // namespace Korvel

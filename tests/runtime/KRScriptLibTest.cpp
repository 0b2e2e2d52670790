#include "runtime/lua/KRScriptLib.h"

#include <gtest/gtest.h>

#include <climits>
#include <cstdlib>
#include <filesystem>
#include <lua.hpp>

#include "Platform/Files.h"
#include "Platform/Processes.h"
#include "Support.h"
#include "runtime/RuntimeHooksInternal.h"

namespace Korvel {
namespace {

using Test::TempDir;

int OpenAll(lua_State* L) {
    OpenAllLibs(L);
    return 0;
}

class KRScriptLib : public testing::Test {
protected:
    KRScriptLib() { EXPECT_EQ(lua_cpcall(m_Lua, OpenAll, nullptr), 0); }
    ~KRScriptLib() override {
        CloseInterpreter(m_Lua);
        g_RuntimeHooks = RuntimeHooks();
    }

    // The text's result or error.
    std::string Run(const std::string& text) {
        lua_settop(m_Lua, 0);
        if (luaL_loadbuffer(m_Lua, text.data(), text.size(), "=test") == 0) {
            lua_pcall(m_Lua, 0, 1, 0);
        }
        const char* result = lua_tostring(m_Lua, -1);
        return result ? result : "";
    }

    lua_State* m_Lua = luaL_newstate();
    TempDir m_Dir;
};

TEST_F(KRScriptLib, HelpersOfScripts) {
    Run(R"(
        function print(...)
            local t = {}
            for i = 1, select('#', ...) do t[i] = tostring((select(i, ...))) end
            printed = (printed or '') .. table.concat(t, ',') .. ';'
        end
        function path(name) return table.concat({splitpath(name)}, '|') end)");
    const char* checks[] = {
        "getpid == orv.getpid and wait == orv.wait and exit == os.exit and ThisApp() == nil",
        "Using == orv.using and SetActiveComp == Using and GetUsing == orv.getusing",
        "iif(false, 1, 2) == 2 and iif(0, 1, 2) == 1",
        "do_(function() return false end) == false and do_(function() end) == true",
        "do_(function() error('e', 0) end) == nil and printed == 'e;'",
        "dostring('return 5') == 5 and dostring('x =') == nil and printed:find('near')",
        "not pcall(dostring) and not pcall(splitpath) and not pcall(callglob, 1)",
        "not pcall(ldofile)",  // nothing for a file is not standard input
        "match('a12', '%d+') == '12'",
        "safegetsymbol({a = false}, 'a') == false and safegetsymbol(nil, 'a') == nil",
        "select('#', trace(1, nil)) == 2 and printed == '1,nil;'",
        "path '/a/b.c/d.tar.gz' == '/a/b.c/|d.tar|gz' and path '' == '||'",
        "path 'c:\\\\d\\\\.rc' == 'c:\\\\d\\\\|.rc|' and path 'd.d/x.' == 'd.d/|x|'",
        "require('krscript') == orv",
    };
    for (const std::string check : checks) {
        EXPECT_EQ(Run("printed = nil return tostring(not not (" + check + "))"), "true") << check;
    }
}

TEST_F(KRScriptLib, DumpEndsOnCycles) {
    Run(R"(
        lines = ''
        function print(line) lines = lines .. line .. '\n' end
        local function named(name, t)
            return setmetatable(t, {__tostring = function() return name end})
        end
        t = named('T', {5})
        t[2] = named('U', {named('V', {}), t})
        t[3] = t[2][1])");
    EXPECT_EQ(Run("dump(t, 'x', nil) return lines"),
              "T\n\t1 = 5\n\t2 = U\n\t\t1 = V\n\t\t2 = T\n\t\t<<recursive reference>>\n"
              "\t3 = V\n\t<<recursive reference>>\nx\nnil\n");
    EXPECT_EQ(Run("t[4] = _G return dumptostring(t, 'x')"),
              "T\n\t1 = 5\n\t2 = U\n\t\t1 = V\n\t\t<<recursive reference>>\n"
              "\t<<recursive reference>>\n\t<<global table>>\nx\n");
    EXPECT_EQ(Run("return dumptostring(_G):match('<<global table>>')"), "<<global table>>");
    // Nested deeper than the stack goes.
    EXPECT_NE(Run("for i = 1, 1e5 do t = {t} end dumptostring(t)").find("overflow"), -1ul);
}

TEST_F(KRScriptLib, FilesKeepTheirGlobals) {
    std::string inner = m_Dir.Write("inner.lua",
                                    "hidden, globals.from_inner = 1, 'i'\n"
                                    "return shared, ...");
    std::string outer = m_Dir.Write("outer.lua",
                                    "shared = 's'\n"
                                    "local seen, arg = ldofile('" +
                                        inner +
                                        "', 7)\n"
                                        "globals.result = seen .. arg .. tostring(hidden)");
    EXPECT_EQ(Run("callglob(loadfile('" + outer + "')) " +
                  "return tostring(shared) .. tostring(hidden) .. from_inner .. result"),
              "nilnilis7nil");
    // Behind a tail call there is no caller to be found.
    EXPECT_EQ(Run("return (function() return callglob(function() return from_inner end) end)()"),
              "i");
    EXPECT_EQ(Run("\nldofile('missing')"),
              "test:2: cannot open missing: No such file or directory");
}

TEST_F(KRScriptLib, ActiveObjectStandsBehindTheGlobals) {
    EXPECT_EQ(Run("return tostring(Using({})) .. type(Using()) .. tostring(GetUsing())"),
              "niltablenil");
    EXPECT_EQ(Run(R"(
        local object, registry, flags = newproxy(true), debug.getregistry(), {}
        getmetatable(object).__index = function(self, key)
            flags[#flags + 1] = tostring(registry.KorvelScriptIgnoreErrors)
            if key == "bad" then error("no member " .. key, 0) end
            if key == "nested" then return other end  -- looked up here again
            if key == "other" then return "o" end
            if key == "Self" then return rawequal end
            if key == "Script" then return function(...) return select("#", ...) end end
        end
        orv.using(object)
        local result = tostring(missing) .. nested .. tostring(Self(object)) .. Script(1)
        assert(select(2, pcall(function() return bad end)) == "no member bad")
        assert(registry.KorvelScriptIgnoreErrors == false)
        print = print  -- a global stays one
        return result .. table.concat(flags, " "))"),
              "nilotrue1true true true true true true");
    EXPECT_EQ(Run("Using(setmetatable({}, {__index = _G})) return missing"),
              "the active object looks itself up for ever");
    EXPECT_EQ(Run("Using(5) return missing"), "attempt to index a number value");
    EXPECT_EQ(Run("Using(nil) return tostring(missing)"), "nil");
}

std::string s_Asked;

TEST_F(KRScriptLib, FindsEmbeddedModules) {
    g_RuntimeHooks.m_FindResource = [](const char* path, std::string_view& content) {
        std::string name(path);
        s_Asked += name + " ";
        if (name == ":/Resources/KorvelScript/a/b.lua") {
            content = "return (...) .. debug.getinfo(1).source";
        } else if (name == ":/Resources/KorvelScript/broken/init.lua") {
            content = "x =\n= 1";
        } else {
            return false;
        }
        return true;
    };
    s_Asked = "";
    EXPECT_EQ(Run("return require 'a.b'"), "a.ba/b");
    EXPECT_EQ(Run("package.preload.own = function() return 'p' end return require 'own'"), "p");
    EXPECT_NE(Run("require 'broken'").find("[string \"broken\"]:2: "), -1ul);
    s_Asked = "";
    EXPECT_NE(Run("require 'c.d'").find("module 'c.d' not found:\n"), -1ul);
    EXPECT_EQ(s_Asked,
              ":/Resources/KorvelScript/c/d.lua :/Resources/KorvelScript/c/d/init.lua "
              ":/Resources/KorvelScript/c/d/c/d.lua ");
    EXPECT_EQ(Run("return #package.loaders"), "5");
}

TEST_F(KRScriptLib, SearchPathsTakeInTheEnvironment) {
    std::string folder = std::filesystem::canonical(OXSCRIPT).parent_path().string() + "/";
    struct Case {
        const char* setting;  // of the environment, or its absence
        const char* value;
        std::string path;
    };
    const Case cases[] = {
        {"KORVEL_TEST_PATH", "v/?.lua", "v/?.lua"},
        {"KORVEL_TEST_PATH=", "v", ""},
        {"KORVEL_TEST_PATH=;;a;;", "v;;w!", ";v;;w" + folder + ";a;v;;w" + folder + ";"},
        {"KORVEL_TEST_PATH=!?.lua;x", "v", folder + "?.lua;x"},
        {"KORVEL_TEST_PATH=a;;", nullptr, "a;;"},
    };
    for (const Case& c : cases) {
        Platform::PutEnv(c.setting);
        SetLuaPath(m_Lua, "path", "KORVEL_TEST_PATH", c.value);
        EXPECT_EQ(Run("return package.path"), c.path) << c.setting;
    }
    Platform::PutEnv("KORVEL_TEST_PATH");

    char buffer[Platform::kMaxPath];
    int size = static_cast<int>(folder.size());
    EXPECT_EQ(Platform::GetSystemFolder(Platform::SF_Library, nullptr, 0), 4096);
    EXPECT_EQ(Platform::GetSystemFolder(Platform::SF_Library, buffer, size), 0);
    EXPECT_EQ(Platform::GetSystemFolder(Platform::SF_Library, buffer, size + 1), 4096);
}

// Globals that refuse what the library sets, and an _ALERT that fails itself.
TEST(KRScriptLibOpening, GoesOnWhereAScriptFails) {
    lua_State* L = luaL_newstate();
    luaL_openlibs(L);
    lua_register(L, "open", luaopen_krscript);
    EXPECT_EQ(luaL_dostring(L, R"(
        local meta = {__index = error, __newindex = function(t, key, value)
            if key == "iif" then error("locked") end
            rawset(t, key, value)
        end}
        local told
        _ALERT = function(message) told = message error("again") end
        setmetatable(_G, meta)
        assert(open() == orv and told:find("locked") and missing == nil and ldofile == nil)
        assert(getmetatable(_G) == meta and meta.__newindex and meta.__index ~= error))"),
              0)
        << lua_tostring(L, -1);
    CloseInterpreter(L);
}

// All interpreters but the first load bytecode; their functions still know where they come from.
TEST(KRScriptLibOpening, KeepsDebugInformation) {
    for (int i = 0; i < 2; i++) {
        lua_State* L = luaL_newstate();
        EXPECT_EQ(lua_cpcall(L, OpenAll, nullptr), 0);
        EXPECT_EQ(luaL_dostring(L, R"lua(
            local info = debug.getinfo(callglob, "Sl")
            assert(info.source:find("function callglob(f, ...)", 1, true) and info.linedefined > 1)
            local function handler() return debug.getlocal(3, 1) end
            assert(select(2, xpcall(ldofile, handler)) == "file"))lua"),
                  0)
            << lua_tostring(L, -1);
        CloseInterpreter(L);
    }
}

// Memory that runs out at any point of opening is an error, not a crash.
TEST(KRScriptLibOpening, SurvivesALackOfMemory) {
    auto alloc = [](void* left, void* block, size_t, size_t size) -> void* {
        if (size == 0) return free(block), nullptr;
        return --*static_cast<int*>(left) > 0 ? realloc(block, size) : nullptr;
    };
    bool isOpen = false;
    int failures = 0;
    for (int limit = 20; !isOpen; limit += 17) {
        int left = limit;
        lua_State* L = lua_newstate(alloc, &left);
        if (!L) continue;
        isOpen = lua_cpcall(L, OpenAll, nullptr) == 0;
        failures += !isOpen;
        left = INT_MAX;
        CloseInterpreter(L);
    }
    EXPECT_GT(failures, 10);
}

}  // namespace
}  // namespace Korvel

// The library as a module of the interpreters that the system offers, in real processes.
#include <gtest/gtest.h>

#include <filesystem>

#include "Support.h"

namespace Korvel {
namespace {

using Test::HostProcess;
using Test::ProcessResult;
using Test::RunProcess;
using Test::ServerTool;
using Test::TempDir;

class Require : public testing::TestWithParam<const char*> {};

TEST_P(Require, OpensTheHostLibrary) {
    std::string folder = std::filesystem::path(SHARED_LIBRARY).parent_path().string();
    TempDir dir;
    std::string script = dir.Write("script.lua", R"(
        local print_before = print
        setmetatable(_G, {__newindex = error, __index = error})
        assert(not pcall(require, "krscript"))  -- the globals are closed
        setmetatable(_G, nil)
        package.loaded.krscript = nil
        assert(require "krscript" == orv and orv._VERSION == "18.0" and ondry.using == orv.using)
        assert(print == print_before and lpeg == nil and #package.loaders == 4)
        local ok, message = pcall(os.exit, 3, {a = 1})
        assert(not ok and message == "" and _EXITCODE == 3 and _EXITDATA.a == 1)
        callglob(function() own = 1 globals.shared = 2 end)
        assert(own == nil and shared == 2)
        -- Members of the active object that raise, in and out of a coroutine.
        orv.using(setmetatable({Add = math.max}, {__index = function(_, key)
            if key == "bad" then error("bad member", 0) end
        end}))
        assert(missing == nil and not pcall(Add, 1))
        assert(select(2, pcall(coroutine.wrap(function() return bad end))) == "bad member")
        assert(debug.getregistry().KorvelScriptIgnoreErrors == false)
        orv.using(setmetatable({}, {__index = _G}))
        assert(not pcall(function() return missing end))
        orv.using()
        -- Blocks that finalisers make do not set off the collector in the middle of its work.
        for _ = 1, 2000 do
            getmetatable(newproxy(true)).__gc = function() assert(MemBlock(100000)) end
        end
        collectgarbage()
        printerr("told")
        error("last", 0))");
    std::vector<std::string> settings = {"LUA_CPATH=" + folder + "/?.so", "LD_PRELOAD=" PRELOAD,
                                         "ASAN_OPTIONS=detect_leaks=0"};
    ProcessResult result = RunProcess({GetParam(), script}, settings);
    EXPECT_EQ(result.m_Status, 1);
    EXPECT_EQ(result.m_Err.find("told\n" + std::string(GetParam()) + ": last\n"), 0u)
        << result.m_Err;
}

// There the process is a client: it finds hosts, and what it has sent last arrives.
TEST_P(Require, MakesAClient) {
    std::string folder = std::filesystem::path(SHARED_LIBRARY).parent_path().string();
    ServerTool tool(OXSCRIPT);
    HostProcess host(MEDIAHOST);
    TempDir dir;
    std::string script = dir.Write("script.lua", R"(
        require "krscript"
        assert(orv.getappname() == "korvelscript" and orv.scriptapp("Nobody") == nil)
        local host = orv.scriptapp("MediaHost", nil, 10)
        host.Title = "Plain"
        assert(host.Title == "Plain" and host:GetAppData().Name == "MediaHost")
        assert(not pcall(orv.sendnotify, host, io.stdout))
        orv.sendnotify(host, "Quit"))");
    std::vector<std::string> settings = {"LUA_CPATH=" + folder + "/?.so", "LD_PRELOAD=" PRELOAD,
                                         "ASAN_OPTIONS=detect_leaks=0"};
    ProcessResult result = RunProcess({GetParam(), script}, settings);
    EXPECT_EQ(result.m_Status, 0) << result.m_Err;
    EXPECT_EQ(host.End(0), 0);
}

INSTANTIATE_TEST_SUITE_P(Interpreters, Require, testing::Values("luajit", "lua5.1"));

}  // namespace
}  // namespace Korvel

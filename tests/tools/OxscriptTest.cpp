// The command line tool, as a real process.
#include <gtest/gtest.h>

#include "Support.h"

namespace Korvel {
namespace {

using Test::ProcessResult;
using Test::RunProcess;
using Test::TempDir;

class Oxscript : public testing::Test {
protected:
    ProcessResult Run(const std::string& text, std::vector<std::string> args = {}) {
        std::vector<std::string> argv = {OXSCRIPT, m_Dir.Write("script.lua", text)};
        argv.insert(argv.end(), args.begin(), args.end());
        return RunProcess(argv);
    }

    TempDir m_Dir;
};

bool Contains(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

TEST_F(Oxscript, GivesTheScriptsResultAsItsStatus) {
    struct Case {
        const char* text;
        int status;
    };
    const Case cases[] = {{"", 0},
                          {"return 7", 7},
                          {"return 255", 255},
                          {"return 256", 255},
                          {"return -1", 255},
                          {"os.exit(3)", 3},
                          {"os.exit()", 0},
                          {"coroutine.wrap(function() os.exit(4) end)()", 4},
                          {"setmetatable(_G, {__index = error, __newindex = error}) os.exit(5)", 5},
                          {"os.exit(300)", 255},
                          {"return arg.n", 2}};
    for (const Case& c : cases) {
        ProcessResult result = Run(c.text, {"--help", "a b"});
        EXPECT_EQ(result.m_Status, c.status) << c.text;
        EXPECT_EQ(result.m_Out + result.m_Err, "") << c.text;
    }
}

TEST_F(Oxscript, ShowsAnErrorWithItsTraceback) {
    ProcessResult result =
        Run("local function inner() local x = nil; return x.y end\nprint(1)\n"
            "inner() return 0");
    EXPECT_EQ(result.m_Status, 255);
    EXPECT_EQ(result.m_Out, "1\n");
    EXPECT_TRUE(Contains(result.m_Err, "script.lua:1: attempt to index local 'x'")) << result.m_Err;
    EXPECT_TRUE(Contains(result.m_Err, "stack traceback:")) << result.m_Err;
    EXPECT_TRUE(Contains(result.m_Err, "script.lua:3: in main chunk")) << result.m_Err;

    result = Run("error(setmetatable({}, {__tostring = function() return 'own text' end}))");
    EXPECT_TRUE(Contains(result.m_Err, "own text")) << result.m_Err;
    result = Run("error({})");
    EXPECT_TRUE(Contains(result.m_Err, "error object is a table value")) << result.m_Err;
    result = Run("error('')");
    EXPECT_EQ(result.m_Status, 255);
    EXPECT_TRUE(Contains(result.m_Err, "stack traceback:")) << result.m_Err;
    result = Run("error(setmetatable({}, {__tostring = function() error('again') end}))");
    EXPECT_EQ(result.m_Status, 255);
    EXPECT_NE(result.m_Err, "");
}

TEST_F(Oxscript, TellsWhatCannotBeLoaded) {
    ProcessResult result = Run("x = = 1");
    EXPECT_EQ(result.m_Status, 255);
    EXPECT_TRUE(Contains(result.m_Err, "script.lua:1: ")) << result.m_Err;
    EXPECT_FALSE(Contains(result.m_Err, "traceback")) << result.m_Err;

    result = RunProcess({OXSCRIPT, m_Dir.Path("missing.lua")});
    EXPECT_EQ(result.m_Status, 255);
    EXPECT_TRUE(Contains(result.m_Err, "missing.lua: No such file")) << result.m_Err;
}

TEST_F(Oxscript, ExplainsItself) {
    ProcessResult help = RunProcess({OXSCRIPT, "--help"});
    EXPECT_EQ(help.m_Status, 0);
    EXPECT_TRUE(Contains(help.m_Out, "Usage: oxscript FILE [ARGS...]")) << help.m_Out;
    ProcessResult version = RunProcess({OXSCRIPT, "--version"});
    EXPECT_EQ(version.m_Status, 0);
    EXPECT_TRUE(Contains(version.m_Out, "oxscript 18.")) << version.m_Out;
    for (const std::vector<std::string>& wrong :
         {std::vector<std::string>{OXSCRIPT}, {OXSCRIPT, "--unknown", "x.lua"}}) {
        ProcessResult result = RunProcess(wrong);
        EXPECT_EQ(result.m_Status, 2);
        EXPECT_TRUE(Contains(result.m_Err, "Usage:")) << result.m_Err;
    }
}

TEST_F(Oxscript, RunsTheDemo) {
    ProcessResult result = RunProcess({OXSCRIPT, DEMO_SCRIPT});
    EXPECT_EQ(result.m_Status, 0) << result.m_Err;
    EXPECT_TRUE(Contains(result.m_Out, "Parsed a frame of 1920 by 1080")) << result.m_Out;
}

}  // namespace
}  // namespace Korvel

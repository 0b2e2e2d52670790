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

    // Runs it with these options, and with a text for its standard input.
    ProcessResult RunInput(const std::string& text, std::vector<std::string> args = {}) {
        std::string input = m_Dir.Write("input", text);
        args.insert(args.begin(), {"/bin/sh", "-c", "exec \"$@\" <" + input, "sh", OXSCRIPT});
        return RunProcess(args);
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
    EXPECT_TRUE(Contains(help.m_Out, "Usage: oxscript [OPTIONS] FILE [ARGS...]")) << help.m_Out;
    ProcessResult version = RunProcess({OXSCRIPT, "--version"});
    EXPECT_EQ(version.m_Status, 0);
    EXPECT_TRUE(Contains(version.m_Out, "oxscript 18.")) << version.m_Out;
}

TEST_F(Oxscript, RefusesAWrongCommandLine) {
    struct Case {
        std::vector<std::string> args;
        const char* message;
    };
    const Case cases[] = {{{"--unknown", "x.lua"}, "Usage:"},
                          {{"-e"}, "Usage:"},
                          {{"-l", "cobol", "x.lua"}, "there is no language 'cobol'"},
                          {{"-l", "Py2", "x.lua"}, "the language Python2 is not available"},
                          {{"x.py3"}, "the language Python3 is not available"},
                          {{"a.b/x.txt"}, "no language has files like x.txt; name one with -l"}};
    for (const Case& c : cases) {
        ProcessResult result = RunInput("print('run')", c.args);
        EXPECT_EQ(result.m_Status, 2) << c.message;
        EXPECT_EQ(result.m_Out, "") << c.message;
        EXPECT_TRUE(Contains(result.m_Err, c.message)) << result.m_Err;
    }
}

TEST_F(Oxscript, RunsTextsAndItsInput) {
    std::string file = m_Dir.Write("\xff=1.Lua", "return one + 4");  // no text, and no argument
    std::string program = m_Dir.Write(".d.txt", "return arg.n");
    struct Case {
        std::vector<std::string> args;
        std::string input;
        int status;
        std::string out;
        std::string err;
    };
    const Case cases[] = {
        {{"-e", "one = 1", "-e", "print(one) return 2"}, "return 9", 2, "1\n", ""},
        {{"-e", "one = 1", file}, "", 5, "", ""},
        {{"-e", "error('x')", file}, "", 255, "", "oxscript: (command line):1: x\n"},
        {{"-e", "os.exit(3)", file}, "", 3, "", ""},
        {{"-q", "-e", "error('x', 0)"}, "", 255, "", "x\nstack traceback:\n"},
        {{"-e", "-- \xc3("}, "", 255, "", "oxscript: (command line):1: this is not UTF-8 text"},
        {{"-l", "LUA", program, "a"}, "", 1, "", ""},
        {{}, "#!/bin/sh\nprint(arg[1])\nreturn 4", 4, "nil\n", ""},
        {{"-", "a"}, "print(arg[0], arg[1])", 0, "-\ta\n", ""},
        {{}, "print(1)\n+", 255, "", "oxscript: stdin:2: "},
        {{}, std::string("x\n\0", 3), 255, "", "oxscript: stdin:2: this is not UTF-8 text"},
        {{"-"}, "\xff", 255, "", "oxscript: stdin:1: this is not UTF-8 text"},
        {{"-"}, "\x1bLJ\x02", 255, "", "oxscript: stdin:1: this is not UTF-8 text"},
        {{"-"}, "print(1) error('', 0)", 255, "1\n", "oxscript: \n"},
        {{"-q", "-i"}, "1, nil\nfor i = 1, 2 do\nend\nos.exit(8)", 8, "1\tnil\n", ""},
    };
    for (const Case& c : cases) {
        ProcessResult result = RunInput(c.input, c.args);
        EXPECT_EQ(result.m_Status, c.status) << c.input;
        EXPECT_EQ(result.m_Out, c.out) << c.input;
        EXPECT_EQ(result.m_Err.substr(0, c.err.size()), c.err) << result.m_Err;
        EXPECT_EQ(result.m_Err.empty(), c.err.empty()) << result.m_Err;
    }
}

TEST_F(Oxscript, RunsTheDemo) {
    ProcessResult result = RunProcess({OXSCRIPT, DEMO_SCRIPT});
    EXPECT_EQ(result.m_Status, 0) << result.m_Err;
    EXPECT_TRUE(Contains(result.m_Out, "Parsed a frame of 1920 by 1080")) << result.m_Out;
}

}  // namespace
}  // namespace Korvel

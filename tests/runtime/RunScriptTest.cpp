#include "runtime/lua/RunScript.h"

#include <dlfcn.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <pthread.h>

#include <lua.hpp>

#include "Support.h"
#include "runtime/lua/KRScriptLib.h"

namespace Korvel {
namespace {

using Test::TempDir;

class RunScriptTest : public testing::Test {
protected:
    int Run(const std::string& text, std::vector<std::string> args = {}) {
        std::vector<char*> argv;
        for (std::string& arg : args) argv.push_back(arg.data());
        argv.push_back(nullptr);
        std::string path = m_Dir.Write("script.lua", text);
        testing::internal::CaptureStderr();
        int result = RunScript(path.c_str(), argv.data());
        m_Errors = testing::internal::GetCapturedStderr();
        return result;
    }

    TempDir m_Dir;
    std::string m_Errors;
};

TEST_F(RunScriptTest, ReturnsTheScriptsFirstNumber) {
    struct Case {
        const char* text;
        int result;
    };
    const Case cases[] = {
        {"", 0},
        {"return 3, 4", 3},
        {"return -7.9", -7},
        {"return '5'", 0},
        {"return true", 0},
        {"return 0/0", 0},
        {"return 1e99", INT_MAX},
        {"return -1/0", INT_MIN},
        {"#!/bin/sh\nreturn 2", 2},
    };
    for (const Case& c : cases) EXPECT_EQ(Run(c.text), c.result) << c.text;
    EXPECT_EQ(m_Errors, "");
}

TEST_F(RunScriptTest, ReportsFailures) {
    EXPECT_EQ(Run("error('told', 0)"), -1);
    EXPECT_EQ(m_Errors, "told\n");
    EXPECT_EQ(Run("error({})"), -1);
    EXPECT_EQ(m_Errors, "unknown error\n");
    EXPECT_EQ(Run("os.exit(3)"), -1);
    EXPECT_EQ(m_Errors, "\n");
    EXPECT_EQ(Run("if then"), -2);
    EXPECT_NE(m_Errors.find("script.lua:1:"), std::string::npos) << m_Errors;
    EXPECT_EQ(Run("local function f() return f() + 1 end f()"), -1);
    EXPECT_NE(m_Errors, "");

    testing::internal::CaptureStderr();
    EXPECT_EQ(RunScript(m_Dir.Path("missing.lua").c_str(), nullptr), -2);
    EXPECT_EQ(RunScript(m_Dir.Path("").c_str(), nullptr), -2);
    EXPECT_EQ(RunScript(nullptr, nullptr), -2);
    EXPECT_NE(testing::internal::GetCapturedStderr().find("missing.lua"), std::string::npos);
}

TEST_F(RunScriptTest, SplitsArguments) {
    const char* script = R"(
        assert(arg[1] == "a" and arg.key == "v=w" and arg[2] == "" and arg[""] == "x")
        assert(arg[3] == nil and arg[0] == nil)
        return arg.n)";
    EXPECT_EQ(Run(script, {"a", "key=v=w", "", "=x"}), 2);
    EXPECT_EQ(Run("return arg.n"), 0);
}

TEST_F(RunScriptTest, OpensTheHostLibraryTwice) {
    EXPECT_EQ(Run(R"(
        assert(orv._VERSION == "18.0" and ondry._VERSION == "18.0" and orv ~= ondry)
        assert(orv.getpid == ondry.getpid and orv.exit == os.exit)
        assert(require("orv") == orv and require("lpeg") == lpeg and lpeg.match("a", "a") == 2)
        assert(orv.getpid() > 1 and orv.getuptime() > 1e9)
        local start = orv.gettime()
        orv.wait(0.02); orv.wait(-1); orv.wait(0/0); orv.wait(); orv.wait("x")
        local passed = orv.gettime() - start
        assert(passed >= 0.02 and passed < 60, passed)
        return 1)"),
              1)
        << m_Errors;
}

TEST_F(RunScriptTest, ExitLeavesItsArgumentsInGlobals) {
    EXPECT_EQ(Run(R"(
        local ok, message = pcall(os.exit, 3, {a = 1})
        assert(not ok and message == "" and _EXITCODE == 3 and _EXITDATA.a == 1)
        pcall(orv.exit, "x", 5)
        assert(_EXITCODE == 0 and _EXITDATA == nil)
        return 1)"),
              1)
        << m_Errors;
}

// Hosts and interpreters load the library itself, late, and find the exported names.
TEST(SharedLibrary, LoadsLateAndShowsItsEntries) {
    void* library = dlopen(SHARED_LIBRARY, RTLD_NOW | RTLD_LOCAL);
    ASSERT_NE(library, nullptr) << dlerror();
    for (const char* name : {"RunScript", "luaopen_krscript"}) {
        EXPECT_NE(dlsym(library, name), nullptr) << name;
    }
    EXPECT_EQ(dlsym(library, "luaopen_lpeg"), nullptr);

    auto open = reinterpret_cast<lua_CFunction>(dlsym(library, "luaopen_krscript"));
    lua_State* L = luaL_newstate();
    luaL_openlibs(L);
    lua_pushcfunction(L, open);
    EXPECT_EQ(lua_pcall(L, 0, 1, 0), 0);
    lua_getfield(L, -1, "_VERSION");
    EXPECT_STREQ(lua_tostring(L, -1), "18.0");
    lua_close(L);
    dlclose(library);
}

// A host may have used up the keys of thread-local values. The pools then work without magazines,
// and leave the host's keys alone.
TEST(SharedLibrary, LoadsWhereNoKeyIsLeft) {
    std::vector<pthread_key_t> keys;
    for (pthread_key_t key; pthread_key_create(&key, nullptr) == 0;) keys.push_back(key);
    std::vector<void*> values;  // the test framework has keys, too
    for (pthread_key_t key = 0; key < PTHREAD_KEYS_MAX; key++) {
        values.push_back(pthread_getspecific(key));
    }
    void* library = dlopen(SHARED_LIBRARY, RTLD_NOW | RTLD_LOCAL);
    ASSERT_NE(library, nullptr) << dlerror();
    using Alloc = void* (*)(size_t);
    auto alloc = reinterpret_cast<Alloc>(dlsym(library, "_ZN6Korvel6ReusernwEm"));
    auto release = reinterpret_cast<void (*)(void*)>(dlsym(library, "_ZN6Korvel6ReuserdlEPv"));
    ASSERT_TRUE(alloc && release);
    void* block = alloc(64);
    release(block);
    EXPECT_EQ(alloc(64), block);
    release(block);
    for (pthread_key_t key = 0; key < PTHREAD_KEYS_MAX; key++) {
        EXPECT_EQ(pthread_getspecific(key), values[key]) << key;
    }
    for (pthread_key_t key : keys) pthread_key_delete(key);
}

}  // namespace
}  // namespace Korvel

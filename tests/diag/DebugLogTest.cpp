#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <thread>
#include <vector>

#include "Support.h"
#include "diag/Debug.h"

namespace Korvel {
namespace {

namespace fs = std::filesystem;
using Korvel::Test::RunProcess;

// Prints before the library has begun, if the linker puts it first, and after it has ended.
struct AtAnyTime {
    AtAnyTime() { g_ScriptServerLog.PrintF("early\n"); }
    ~AtAnyTime() { g_ScriptServerLog.PrintF("late %d\n", 7); }
} s_AtAnyTime;

constexpr char kSwitch[] = "DebugLogTest_Switch";

struct Log : testing::Test {
    std::string FileOf(const std::string& base) const {
        return base + "_" + std::to_string(getpid()) + ".log";
    }
    static bool Matches(const std::string& text, const std::string& pattern) {
        return testing::Matcher<const std::string&>(testing::MatchesRegex(pattern)).Matches(text);
    }
    void ExpectMatch(const std::string& path, const std::string& pattern) const {
        std::ifstream file(path);
        std::string text(std::istreambuf_iterator<char>(file), {});
        EXPECT_TRUE(Matches(text, pattern)) << text;
    }
    const std::string m_Header =
        "\n\n-{8} [0-9]{2}/[A-Z][a-z]{2}/[0-9]{2} [0-9]{2}:[0-9]{2}:[0-9]{2} -{8}\n[?]{3}\n";
    const std::string m_Prefix = "-?[0-9]+ \\[ [ 0-9]{3,}[0-9]\\] ";
    Korvel::Test::TempDir m_Dir;
    const std::string m_Base = m_Dir.Path("log");
};

TEST_F(Log, IsSwitchedByTheEnvironment) {
    struct Case {
        const char* value;
        bool defaultOn, isOn;
    };
    const Case cases[] = {{nullptr, false, false}, {nullptr, true, true}, {"TRUE", false, true},
                          {"1", true, false},      {"", true, false},     {"true ", true, false}};
    for (const Case& c : cases) {
        c.value ? setenv(kSwitch, c.value, 1) : unsetenv(kSwitch);
        DebugLog(kSwitch, m_Base.c_str(), c.defaultOn).PrintF("entry\n");
        EXPECT_EQ(fs::remove(FileOf(m_Base)), c.isOn) << (c.value ? c.value : "none");
    }
    for (const std::string& base : {m_Dir.Path("missing/log"), std::string(5000, 'x')}) {
        DebugLog(nullptr, base.c_str(), true).PrintF("%s", "nowhere");
    }
}

TEST_F(Log, AppendsEntriesBehindAHeader) {
    DebugLog first(nullptr, m_Base.c_str(), true);
    first.PrintF("no line end, ");
    DebugLog second(nullptr, m_Base.c_str(), true);
    first.PrintF("%s %d\n", "line", 1);
    ExpectMatch(FileOf(m_Base),
                m_Header + m_Prefix + "no line end, " + m_Header + m_Prefix + "line 1\n");
}

TEST_F(Log, KeepsEntriesOfManyThreadsApart) {
    DebugLog log(nullptr, m_Base.c_str(), true);
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; i++) {
        threads.emplace_back([&] {
            for (int j = 0; j < 50; j++) log.PrintF("%s of %d\n", "an entry", j);
        });
    }
    for (std::thread& thread : threads) thread.join();
    ExpectMatch(FileOf(m_Base), m_Header + "(" + m_Prefix + "an entry of [0-9]+\n){200}");
}

TEST_F(Log, OfTheServerWorksUntilTheEnd) {
    std::string dir = m_Dir.Path("."), self = fs::read_symlink("/proc/self/exe");
    std::string command = "cd '" + dir + "' && exec '" + self + "' --gtest_list_tests";
    for (const char* setting : {"OXSCRIPT_LOG_SERVER=no", "OXSCRIPT_LOG_SERVER=true"}) {
        EXPECT_TRUE(fs::is_empty(dir));
        EXPECT_EQ(RunProcess({"sh", "-c", command}, {setting}).m_Status, 0);
    }
    ASSERT_FALSE(fs::is_empty(dir));
    fs::path file = *fs::directory_iterator(dir);
    EXPECT_TRUE(Matches(file.filename(), R"(C:\\KorvelScriptServer_[0-9]+\.log)"));
    ExpectMatch(file, m_Header + "(" + m_Prefix + "early\n)?" + m_Prefix + "late 7\n");
}

}  // namespace
}  // namespace Korvel

// Programs run in our interpreter and in the distribution's, which must print the same: results,
// messages and the order of keys.
#include <gtest/gtest.h>

#include <cstdio>
#include <sstream>
#include <string>

namespace {

std::string RunIn(const char* interpreter, const std::string& program) {
    std::string command = std::string("cd '") + PROGRAMS + "' && '" + interpreter + "' ";
    command += program;
    command += " 2>&1";
    FILE* pipe = popen(command.c_str(), "r");
    if (!pipe) return "no pipe";
    std::string output;
    char buffer[4096];
    while (size_t size = fread(buffer, 1, sizeof buffer, pipe)) output.append(buffer, size);
    if (pclose(pipe) != 0) output.append("(failed)\n");
    return output;
}

class Differential : public testing::TestWithParam<const char*> {};

TEST_P(Differential, PrintsTheSame) {
    if (*LUA51 == 0) GTEST_SKIP() << "lua5.1 is not installed";
    std::istringstream theirs(RunIn(LUA51, GetParam()));
    std::istringstream ours(RunIn(TEXTLUA, GetParam()));
    std::string their, our;
    int line = 0;
    int differences = 0;
    while (std::getline(theirs, their)) {
        line++;
        our.clear();
        std::getline(ours, our);
        if (our == their) continue;
        ADD_FAILURE() << "line " << line << "\ntheirs: " << their << "\nours:   " << our;
        if (++differences == 5) break;
    }
    EXPECT_GT(line, 100) << "the program did not run";
    if (!differences) {
        EXPECT_FALSE(std::getline(ours, our)) << "we print more: " << our;
    }
}

INSTANTIATE_TEST_SUITE_P(Programs, Differential,
                         testing::Values("expressions.lua", "base.lua", "libraries.lua",
                                         "generated.lua", "collector.lua"));

}  // namespace

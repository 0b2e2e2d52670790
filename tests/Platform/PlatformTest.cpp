#include "Platform/Platform.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <string>

#include "Platform/Time.h"

namespace Korvel::Platform {
namespace {

TEST(Processor, AgreesWithTheSystem) {
    std::ifstream file("/proc/cpuinfo");
    std::string text(std::istreambuf_iterator<char>(file), {});
    std::replace(text.begin(), text.end(), '\n', ' ');
    auto says = [&](const char* word) { return text.find(word) != std::string::npos; };
    if (!says(" fpu ")) GTEST_SKIP() << "no x86 processor";
    bool isKnown = says(" GenuineIntel ") || says(" AuthenticAMD ") || says(" VirtualApple ");
    auto has = [&](const char* flag) { return isKnown && says(flag); };
    EXPECT_EQ(Ox_IsSSE3Processor(), has(" pni "));
    EXPECT_EQ(Ox_IsSSSE3Processor(), has(" ssse3 "));
    EXPECT_EQ(Ox_IsSSE41Processor(), has(" sse4_1 "));
    EXPECT_EQ(Ox_IsSSE42Processor(), has(" sse4_2 "));
    EXPECT_EQ(Ox_IsAVXProcessor(), has(" avx "));
    EXPECT_EQ(Ox_IsAVXIProcessor(), has(" avx ") && has(" f16c "));
    EXPECT_EQ(Ox_IsAVX2Processor(), has(" avx2 "));
    EXPECT_EQ(Ox_IsDAZProcessor(), has(" fxsr ") && has(" sse ") && has(" pni "));
    EXPECT_FALSE(Ox_IsECX(~0u));  // some bits are never set
}

TEST(Time, SleepsAtLeastAsLongAsAsked) {
    unsigned long long count = GetTimeCount(), upTime = GetUpTime();
    Wait(30);
    EXPECT_GE(GetTimeCount() - count, 30 * GetTimeFreq() / 1000);
    EXPECT_GE(GetUpTime() + 2, upTime + 30);
    EXPECT_GT(upTime, 1'600'000'000'000u);  // since 1970, not since the start of the system
}

}  // namespace
}  // namespace Korvel::Platform

#include "Platform/Platform.h"

#include <gtest/gtest.h>

#include <fstream>
#include <set>
#include <sstream>
#include <string>

#include "Platform/Time.h"

namespace Korvel::Platform {
namespace {

std::set<std::string> SystemFlags(std::string& vendor) {
    std::ifstream file("/proc/cpuinfo");
    std::string line;
    std::set<std::string> flags;
    while (std::getline(file, line) && flags.empty()) {
        std::istringstream words(line);
        std::string key, colon, word;
        words >> key >> colon;
        if (key == "vendor_id") words >> vendor;
        if (key != "flags") continue;
        while (words >> word) flags.insert(word);
    }
    return flags;
}

TEST(Processor, AgreesWithTheSystem) {
    std::string vendor;
    std::set<std::string> flags = SystemFlags(vendor);
    if (flags.empty()) GTEST_SKIP() << "no x86 processor";
    bool isKnown = vendor == "GenuineIntel" || vendor == "AuthenticAMD" || vendor == "VirtualApple";
    auto has = [&](const char* flag) { return isKnown && flags.contains(flag); };
    EXPECT_EQ(Ox_IsSSE3Processor(), has("pni"));
    EXPECT_EQ(Ox_IsSSSE3Processor(), has("ssse3"));
    EXPECT_EQ(Ox_IsSSE41Processor(), has("sse4_1"));
    EXPECT_EQ(Ox_IsSSE42Processor(), has("sse4_2"));
    EXPECT_EQ(Ox_IsAVXProcessor(), has("avx"));
    EXPECT_EQ(Ox_IsAVXIProcessor(), has("avx") && has("f16c"));
    EXPECT_EQ(Ox_IsAVX2Processor(), has("avx2"));
    EXPECT_EQ(Ox_IsDAZProcessor(), has("fxsr") && has("sse") && has("pni"));
    EXPECT_EQ(Ox_IsECX(1u << 19 | 1u << 9), has("sse4_1") && has("ssse3"));
    EXPECT_FALSE(Ox_IsECX(~0u));  // some bits are never set
    EXPECT_FALSE(Ox_IsSSE4aProcessor());
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

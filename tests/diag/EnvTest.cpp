#include "diag/Env.h"

#include <gtest/gtest.h>
#include <locale.h>

#include <string>
#include <thread>

#include "Platform/Processes.h"
#include "Support.h"

namespace Korvel {
namespace {

using Platform::GetEnv;
using Platform::PutEnv;

std::string Variable(const char* name) {
    OxStringT<char> value("unset");
    GetEnv(name, value);
    return static_cast<const char*>(value);
}

TEST(Environment, FindsNamesWhateverTheirCase) {
    {
        std::string setting = "KorvelTestName=first";
        PutEnv(setting.c_str());
        setting.assign(setting.size(), '#');  // the environment has a copy
    }
    PutEnv("KORVELTESTNAMELONGER=second");
    EXPECT_EQ(Variable("KORVELTESTNAME"), "first");
    EXPECT_EQ(Variable("korveltestnamelonger"), "second");
    EXPECT_EQ(Variable("KorvelTestNam"), "unset");
    PutEnv("KorvelTestName=");
    EXPECT_EQ(Variable("KorvelTestName"), "");
    PutEnv("KorvelTestName");
    EXPECT_EQ(Variable("KorvelTestName"), "unset");
    PutEnv(
        "KorvelTestByte=\xFF"
        "x");
    EXPECT_EQ(Variable("KorvelTestByte"), "?x");
    OxStringT<char> value;
    EXPECT_FALSE(GetEnv(nullptr, value) || PutEnv(nullptr) || PutEnv(""));
}

class Setting : public testing::Test {
protected:
    ~Setting() override {
        EnvVar::SetEnvCallback(nullptr);
        for (const char* name : {"KORVEL_Test", "KORVEL18_Test", "KORVEL17_Test", "KORVEL16_Test",
                                 "KORVEL15_Test", "PlainTest"}) {
            PutEnv(name);
        }
    }

    // What a fresh setting reads once `settings` stand in the environment.
    template <class Var, class T>
    T Read(T def, std::initializer_list<const char*> settings) {
        for (const char* setting : settings) PutEnv(setting);
        Var var("KORVEL_Test", true, def);
        T value = var;
        m_WasSet = var.IsSet();
        return value;
    }

    bool m_WasSet = false;
};

TEST_F(Setting, TheNewestNumberWins) {
    EXPECT_EQ((Read<EnvInt, int64_t>(7, {"KORVEL15_Test=15"})), 7);
    EXPECT_FALSE(m_WasSet);
    EXPECT_EQ((Read<EnvInt, int64_t>(7, {"KORVEL_Test=1"})), 1);
    EXPECT_EQ((Read<EnvInt, int64_t>(7, {"KORVEL16_Test=16"})), 16);
    EXPECT_EQ((Read<EnvInt, int64_t>(7, {"KORVEL17_Test=17"})), 17);
    EXPECT_EQ((Read<EnvInt, int64_t>(7, {"KORVEL18_Test="})), 0);
    EXPECT_TRUE(m_WasSet);
}

TEST_F(Setting, ParsesEachType) {
    for (const char* yes : {"KORVEL_Test=true", "KORVEL_Test=TRUE", "KORVEL_Test=Yes",
                            "KORVEL_Test=On", "KORVEL_Test=1"}) {
        EXPECT_TRUE((Read<EnvBool, bool>(false, {yes}))) << yes;
    }
    for (const char* no : {"KORVEL_Test=2", "KORVEL_Test=y", "KORVEL_Test=", "KORVEL_Test=1 "}) {
        EXPECT_FALSE((Read<EnvBool, bool>(true, {no}))) << no;
        EXPECT_TRUE(m_WasSet) << no;
    }
    EXPECT_EQ((Read<EnvInt, int64_t>(7, {"KORVEL_Test=-12abc"})), -12);
    EXPECT_EQ((Read<EnvInt, int64_t>(7, {"KORVEL_Test=abc"})), 0);
    EXPECT_EQ((Read<EnvInt, int64_t>(7, {"KORVEL_Test=99999999999999999999"})), INT64_MAX);
    EXPECT_EQ((Read<EnvFloat, double>(7, {"KORVEL_Test=1.5e3x"})), 1500);
}

// In a locale that writes a comma, a point is the decimal sign all the same.
TEST_F(Setting, FloatsIgnoreTheLocale) {
    Korvel::Test::TempDir locales;
    Korvel::Test::RunProcess(
        {"localedef", "-i", "de_DE", "-f", "UTF-8", locales.Path("de_DE.UTF-8")});
    setenv("LOCPATH", locales.Path(".").c_str(), 1);
    ASSERT_TRUE(setlocale(LC_ALL, "de_DE.UTF-8")) << "localedef needs the package 'locales'";
    ASSERT_EQ(strtod("2,5", nullptr), 2.5);
    EXPECT_EQ((Read<EnvFloat, double>(7, {"KORVEL_Test=2.5"})), 2.5);
    EXPECT_EQ((Read<EnvFloat, double>(7, {"KORVEL_Test=2,5"})), 2);
    setlocale(LC_ALL, "C");
}

TEST_F(Setting, FollowsChangesWhenTold) {
    EnvInt following("KORVEL_Test", true, 7), fixed("KORVEL_Test", false, 7);
    PutEnv("KORVEL_Test=1");
    EXPECT_EQ(+following, 1);
    EXPECT_EQ(+fixed, 1);
    PutEnv("KORVEL_Test=2");
    EXPECT_EQ(+following, 1);
    EnvVar::InvalidateEnv();
    EXPECT_EQ(+following, 2);
    EXPECT_EQ(+fixed, 1);
    PutEnv("KORVEL_Test");
    EnvVar::InvalidateEnv();
    EXPECT_EQ(+following, 2);
    EXPECT_FALSE(following.IsSet());
    EXPECT_TRUE(fixed.IsSet());
}

TEST_F(Setting, TheHostAnswersFirst) {
    static std::string s_Asked;
    PutEnv("KORVEL_Test=environment");
    PutEnv("PlainTest=plain");
    EnvString prefixed("KORVEL_Test", true, ""), plain("PlainTest", true, "");
    EnvVar::SetEnvCallback([](const char* name, OxStringT<char>& value) {
        s_Asked += name;
        value = "host";
        return s_Asked == "Test";
    });
    OxStringT<char> text;
    EXPECT_TRUE(prefixed.Get(text));
    EXPECT_STREQ(text, "host");
    EXPECT_TRUE(plain.Get(text));
    EXPECT_STREQ(text, "plain");
    EnvVar::InvalidateEnv();
    EXPECT_TRUE(prefixed.Get(text));
    EXPECT_STREQ(text, "environment");
    EXPECT_EQ(s_Asked, "TestTest");

    PutEnv("KORVEL_Test");
    EnvVar::InvalidateEnv();
    EXPECT_FALSE(prefixed.Get(text));
    EXPECT_STREQ(text, "environment");
}

TEST_F(Setting, ManyThreadsMayLoadAtOnce) {
    PutEnv("KORVEL_Test=5");
    for (int round = 0; round < 50; round++) {
        EnvInt setting("KORVEL_Test", true, 7);
        std::atomic<int> wrong = 0;
        auto read = [&] { wrong += setting != 5; };
        std::thread a(read), b(read);
        a.join();
        b.join();
        ASSERT_EQ(wrong, 0);
    }
}

}  // namespace
}  // namespace Korvel

#include "core/OxID.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "core/FaultsInternal.h"
#include "core/TextCellInternal.h"

namespace Korvel {
namespace {

const char* Raw(const OxID& id) {
    return *reinterpret_cast<const char* const*>(&id);
}

TEST(GetHashValue, MatchesTheKnownValues) {
    struct Case {
        const char* text;
        uint32_t hash;
    };
    const Case cases[] = {{"", 0},
                          {"a", 97},
                          {"A", 97},
                          {"ab", 0xFFFCF7FF},
                          {"AB", 0xFFFCF7FF},
                          {"Error", 0xE1A61F17},
                          {"error", 0xE1A61F17},
                          {"\x80", 0xFFFFFF80}};
    for (const Case& c : cases) EXPECT_EQ(GetHashValue(c.text), c.hash) << c.text;
    EXPECT_EQ(GetHashValue(nullptr), 0u);
    EXPECT_EQ(GetHashValue("abc", -1), 0u);
    EXPECT_EQ(GetHashValue("Abc", 2), 0xFFFCF7FFu);
    EXPECT_NE(GetHashValue("a\0b", 3), GetHashValue("a"));  // a NUL is a byte like any other
    EXPECT_NE(GetHashValue("\xC3\x84"), GetHashValue("\xC3\xA4"));
    EXPECT_EQ(OxID("Error").GetHashValue(), 0xE1A61F17u);
}

TEST(OxID, BorrowsSharesAndCopies) {
    const char text[] = "Name";
    OxID borrowed(text);
    EXPECT_EQ(Raw(borrowed), text);
    OxID copied(text, true);
    EXPECT_TRUE(Raw(copied) != text && TextCell::IsCell(Raw(copied)));
    {
        OxID shared(copied), sharedAsText(Raw(copied), true), whole(copied.Mid(0, 4));
        for (const OxID* id : {&shared, &sharedAsText, &whole}) EXPECT_EQ(Raw(*id), Raw(copied));
        EXPECT_EQ(TextCell::Count(Raw(copied)), 4u);
    }
    EXPECT_EQ(TextCell::Count(Raw(copied)), 1u);
    OxID moved(std::move(copied));
    EXPECT_FALSE(copied.IsValid());  // NOLINT(bugprone-use-after-move): the rule under test

    EXPECT_STREQ(OxID("Name.Group", 4ul), "Name");
    EXPECT_STREQ(OxID("ab", 10ul), "ab");
    EXPECT_STREQ(OxID(nullptr, "b"), "b");
    EXPECT_STREQ(OxID("a", static_cast<const char*>(nullptr)), "a");
    EXPECT_STREQ(OxID(moved, Raw(moved)), "NameName");  // skips the marker of a cell
    EXPECT_FALSE(OxID(nullptr, true).IsValid());
}

TEST(OxID, NullIsEmpty) {
    EXPECT_TRUE(NOID == "" && NOID == nullptr && OxID("") == NOID);
    EXPECT_TRUE(OxID("a", true) == OxID("a") && OxID("a") != "A" && OxID("a") != nullptr);
    EXPECT_TRUE(OxID("").IsValid() && OxID("").IsEmpty() && !NOID.IsValid());
    const OxID* volatile none = nullptr;  // volatile, or the compiler sees through the call
    EXPECT_TRUE(!none->IsValid() && none->IsEmpty() && none->GetLength() == 0);
}

TEST(OxID, FindsAndCuts) {
    OxID id("a.b.c");
    struct Case {
        int found, expected;
    };
    const Case cases[] = {
        {id.Find('.'), 1},           {id.Find('.', 2), 3},         {id.Find('.', 5), -1},
        {id.Find('.', -1), -1},      {id.Find('\0'), -1},          {id.ReverseFind('.'), 3},
        {id.ReverseFind('.', 2), 1}, {id.ReverseFind('a', 5), -1}, {id.ReverseFind('x'), -1},
        {NOID.ReverseFind('x'), -1},
    };
    for (const Case& c : cases) EXPECT_EQ(c.found, c.expected) << &c - cases;
    EXPECT_STREQ(id.Mid(2, 1) + id.Mid(2) + id.Mid(2, 100), "bb.cb.c");
    EXPECT_STREQ(id.Mid(-3, 2) + id.Left(3), "a.a.b");
    EXPECT_FALSE(id.Mid(5).IsValid());
}

TEST(OxID, ComparesBeginningsEndsAndGroups) {
    OxID id("Net.Host");
    EXPECT_TRUE(id.BeginsWith("Net") && id.EndsWith("Host") && id.BeginsWith(nullptr));
    EXPECT_FALSE(id.BeginsWith("net") || id.EndsWith("host") || id.EndsWith("xxxNet.Host"));
    EXPECT_TRUE(id.BeginsWithNoCase("nET") && id.EndsWithNoCase("HOST"));
    EXPECT_TRUE(NOID.BeginsWith("") && NOID.EndsWith(nullptr) && !NOID.BeginsWith("a"));

    EXPECT_TRUE(id.IsInGroup() && !OxID("Host").IsInGroup());
    EXPECT_TRUE(id.IsInGroup("Net") && id.IsInGroup("Net.") && id.IsInGroup("Net.Host"));
    EXPECT_FALSE(id.IsInGroup("Ne") || id.IsInGroup("net") || id.IsInGroup(nullptr));
    EXPECT_TRUE(id.IsSameGroup("Net.Port") && OxID("a").IsSameGroup("b"));
    EXPECT_FALSE(id.IsSameGroup("Net") || id.IsSameGroup("Nut.Host") || id.IsSameGroup("N.Host"));

    for (const char* good : {"a", "_", "a9_", "a.b", "a._9"}) {
        EXPECT_TRUE(OxID(good).IsValidSymbol()) << good;
    }
    for (const char* bad : {"", "9a", ".a", "a.", "a..b", "a.9", "a b", "\xC3\xA4"}) {
        EXPECT_FALSE(OxID(bad).IsValidSymbol()) << bad;
    }
}

TEST(OxID, EditsItselfOutOfItsOwnText) {
    OxID id("ab", true);
    id += id;
    id.CatF("-%s", static_cast<const char*>(id));
    id.PrintF("<%s>", static_cast<const char*>(id));
    EXPECT_STREQ(id, "<abab-abab>");
    id.Set(id, 3ul);
    id = id;                            // NOLINT: the rule under test
    id = static_cast<const char*>(id);  // lies in the cell that the assignment drops
    id += '!';
    id += nullptr;
    EXPECT_STREQ("(" + id + ")", "(<ab!)");
    id.PrintF("%0*d", 10000, 1);
    EXPECT_EQ(id.GetLength(), 10000);
}

// Inside of a text byte 0xFF is harmless; at the head of one it would make it a cell.
TEST(OxID, TheMarkerNeverComesToTheHead) {
    OxID id("x.\xFFy", true);
    OxID formatted;
    formatted.PrintF("%s", static_cast<const char*>(id) + 2);
    OxID grown("", true);
    grown += '\xFF';
    EXPECT_STREQ(id.Mid(2), "?y");
    EXPECT_STREQ(formatted, "?y");
    EXPECT_STREQ(grown, "?");
}

TEST(OxID, HoldersOnManyThreadsShareACell) {
    OxID id("shared", true);
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; i++) {
        threads.emplace_back([id] {
            OxID other;
            for (int k = 0; k < 5000; k++) other = OxID(id);
        });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(TextCell::Count(Raw(id)), 1u);
}

#ifdef KORVEL_FAULTS
TEST(OxID, BecomesNullWhereMemoryRunsOut) {
    for (unsigned n = 1; n <= 5; n++) {
        Faults::FailAt(n, true);
        OxID id("text", true);
        id += "more";
        OxID sum = id + "x";
        sum.PrintF("%s", "formatted");
        OxID cut = sum.Left(2);
        Faults::Stop();
        EXPECT_TRUE(n > 1 || !id.IsValid());
        EXPECT_TRUE(n > 4 || !sum.IsValid());
    }
}
#endif

#if !defined(NDEBUG) && !defined(__SANITIZE_THREAD__)
TEST(OxIDDeathTest, AForeignTextWithTheMarkerIsCaught) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    alignas(16) char memory[64] = {};
    char* text = memory + 36;  // as far behind an aligned address as a cell's
    *text = TextCell::kMarker;
    EXPECT_DEATH(OxID(text, true), "0xFF");
    EXPECT_EQ(TextCell::SafeFirstByte('\xFF'), '?');
    EXPECT_EQ(TextCell::SafeFirstByte('\xFE'), '\xFE');
}
#endif

}  // namespace
}  // namespace Korvel

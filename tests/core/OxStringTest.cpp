#include "core/OxString.h"

#include <gtest/gtest.h>

#include <climits>
#include <functional>
#include <optional>
#include <random>
#include <string>
#include <thread>

#include "core/FaultsInternal.h"

namespace Korvel {
namespace {

int Sign(int value) {
    return (value > 0) - (value < 0);
}

// The string's text, after a look at what must always hold.
template <class T>
std::basic_string<T> Content(const OxStringT<T>& string) {
    const T* text = string;
    std::basic_string<T> content(text ? text : string.m_EmptyString);
    EXPECT_EQ(content.size(), static_cast<size_t>(string.GetLength()));
    return content;
}

// Lets an operation's n-th allocation fail, where the build can do so. Returns whether it did.
bool FailsIn(const std::function<void()>& operation, unsigned n, bool forGood) {
#ifdef KORVEL_FAULTS
    Faults::FailAt(n, forGood);
    operation();
    return Faults::Stop() >= n;
#else
    operation();
    return false;
#endif
}

// Where a text is the same in all widths it is written as char, and converted.
template <class T>
class OxStringTest : public testing::Test {};
using Widths = testing::Types<char, wchar_t, char32_t>;
TYPED_TEST_SUITE(OxStringTest, Widths);

// Random editing beside std::basic_string. Arguments often lie in the string's own buffer, a copy
// shares that every so often and must not change, the string may be a zeroed one, and allocations
// fail now and then.
TYPED_TEST(OxStringTest, EditsAsTheModelDoes) {
    using T = TypeParam;
    using Model = std::basic_string<T>;
    constexpr bool kIsUCS4 = std::is_same_v<T, char32_t>;
    // The largest one is far behind all that tests for characters know; NUL is no text.
    const T largest = static_cast<T>(kIsUCS4 ? 0x80000000 : INT_MAX);
    const T units[] = {'a', 'a', 'b', 'B', ' ', '/', ' ', '\\', '\t', '\v', 'Z', largest, 0};
    const T nonUTF8 = kIsUCS4 ? largest : 0;
    const Model spaces{' ', '\t', '\v'};
    std::mt19937 random(7);
    auto below = [&](size_t limit) { return static_cast<int>(random() % limit); };
    auto pickNumber = [&](int usual) {
        const int odd[] = {INT_MIN, -3, -1, INT_MAX};
        return below(4) ? below(static_cast<size_t>(usual)) : odd[below(4)];
    };

    OxStringT<T> string, copy;
    Model model, copyModel, text, other;
    const T *argument, *second;
    T c, d;
    int length, position, count, result, expected;
    size_t begin, kept, most, taken;

    auto pick = [&](Model& picked) {
        picked.clear();
        for (int i = below(6); i > 0; i--) picked += units[below(std::size(units) - 1)];
        if (below(3) || model.empty()) return picked.c_str();
        const T* own = static_cast<const T*>(string) + below(model.size() + 1);
        picked = own;
        return own;
    };
    auto unit = [](T u) { return Model(u ? 1 : 0, u); };
    auto shift = [](Model m, char first, int by) {
        for (T& u : m) u = static_cast<T>(u >= T(first) && u < T(first + 26) ? u + T(by) : u);
        return m;
    };
    auto lower = [&](const Model& m) { return shift(m, 'A', 32); };
    auto insert = [&](const Model& m) {
        model.insert(static_cast<size_t>(position < 0 || position > length ? length : position), m);
    };
    auto replace = [&](const Model& from, const Model& to) {
        for (size_t i = 0; from.size() && (i = model.find(from, i)) < Model::npos; i += to.size()) {
            model.replace(i, from.size(), to);
            expected++;
        }
    };
    auto trimLeft = [&](const Model& set) { model.erase(0, model.find_first_not_of(set)); };
    auto trimRight = [&](const Model& set) { model.erase(model.find_last_not_of(set) + 1); };
    auto join = [&] {
        bool needsSlash = length ? model.back() != '/' && model.back() != '\\' : string.IsValid();
        model += unit(needsSlash ? '/' : 0) + text;
    };
    const std::function<void()> operations[] = {
        [&] { string.TrimLength(count), model = model.substr(0, kept); },
        [&] { string.Empty(), memset(static_cast<void*>(&string), 0, sizeof(string)), model = {}; },
        [&] { string = argument, model = text; },
        [&] { string.Set(argument, most), model = text.substr(0, most); },
        [&] { string.Set(argument, second), model = text + other; },
        [&] { string.Set(argument, string), model = text + model; },
        [&] { string.Set(string, argument), model += text; },
        [&] { string.Set(string, argument, most), model += text.substr(0, most); },
        [&] { string.Set(copy, string), model = copyModel + model; },
        [&] { string.Set(copy, most), model = copyModel.substr(0, most); },
        [&] { string = copy, model = copyModel; },
        [&] { string = *&string; },
        [&] { string += argument, model += text; },
        [&] { string += string, model += Model(model); },
        [&] { string += c, model += unit(c); },
        [&] { join(), string /= argument; },
        [&] { string.Insert(position, c), insert(unit(c)); },
        [&] { string.Insert(position, argument), insert(text); },
        [&] { string.Insert(position, string, count), insert(model.substr(0, taken)); },
        [&] { string.Delete(position, count), model.erase(begin, most); },
        [&] {
            result = string.Replace(argument, second),
            replace(argument == second ? Model() : text, other);
        },
        [&] { result = string.Replace(unit(c).c_str(), second), replace(unit(c), other); },
        [&] { result = string.Replace(c, d), replace(unit(d && c != d ? c : 0), unit(d)); },
        [&] { result = string.Remove(c), replace(unit(c), Model()); },
        [&] { string.Trim(), trimLeft(spaces), trimRight(spaces); },
        [&] { string.Trim(argument), trimLeft(text), trimRight(text); },
        [&] { string.Trim(c), trimLeft(unit(c)), trimRight(unit(c)); },
        [&] { string.TrimLeft().TrimRight(c), trimLeft(spaces), trimRight(unit(c)); },
        [&] { string.TrimLeft(c).TrimRight(), trimLeft(unit(c)), trimRight(spaces); },
        [&] { string.TrimLeft(argument), trimLeft(text); },
        [&] { string.TrimRight(argument), trimRight(text); },
        [&] { string = string.Left(count), model = model.substr(0, kept); },
        [&] { string = string.Mid(position, count), model = model.substr(begin, most); },
        [&] { string = string.Right(count), model.erase(0, model.size() - taken); },
        [&] { string.MakeLower(), model = lower(model); },
        [&] { string.MakeUpper(), model = shift(model, 'a', -32); },
        [&] { string.MakeUnique(); },
        [&] { string.ObtainRaw(5), string.ReleaseRaw(0), model = model.substr(0, 5); },
        [&] {
            if (auto raw = string.AutoRaw(0); raw && length) raw[0] = model[0] = 'q';
        },
        [&] { string = string.ToUTF8(), model = model.find(nonUTF8) + 1 ? Model() : model; },
        [&] { string.CatF(nullptr), model.clear(); },
        [&] { copy = string, copyModel = model; },
    };
    for (int step = 0; step < 20000; step++) {
        SCOPED_TRACE(step);
        length = static_cast<int>(model.size());
        argument = pick(text), second = pick(other);
        c = units[below(std::size(units))], d = units[below(std::size(units))];
        position = pickNumber(length + 3), count = pickNumber(8), result = expected = 0;
        begin = static_cast<size_t>(std::clamp(position, 0, length));
        taken = static_cast<size_t>(std::clamp(count, 0, length));
        kept = static_cast<size_t>(count < 0 ? std::max(length + count, 0) : count);
        most = count < 0 ? Model::npos : static_cast<size_t>(count);
        auto& operation = operations[length > 200 ? 0 : below(std::size(operations))];
        bool failed = FailsIn(operation, static_cast<unsigned>(below(16)) + 1, below(2));
        if (failed && string.IsEmpty()) model.clear(), result = expected;
        ASSERT_EQ(Content(string), model);
        ASSERT_EQ(Content(copy), copyModel);
        ASSERT_EQ(result, expected);
        const T *buffer = string, *shared = copy;
        ASSERT_EQ(string.IsUnique(), buffer != shared || !buffer || buffer == copy.m_EmptyString);

        int start = pickNumber(length + 2);
        bool isInside = start >= 0 && start < string.GetLength();
        size_t from = static_cast<size_t>(start);
        auto at = [&](size_t found) { return isInside ? static_cast<int>(found) : -1; };
        Model small = lower(model);
        ASSERT_EQ(string.Find(c, start), at(model.find(c, from)));
        ASSERT_EQ(string.ReverseFind(c), static_cast<int>(model.rfind(c)));
        ASSERT_EQ(string.ReverseFind(c, start == -1 ? -2 : start), at(model.rfind(c, from)));
        ASSERT_EQ(string.HasLower(), model != shift(model, 'a', -32));
        ASSERT_EQ(string.HasUpper(), model != small);
        ASSERT_EQ(string == copy, model == copyModel);
        for (const Model& m : {text, other, copyModel}) {
            const T* t = m.c_str();
            Model smallText = lower(m);
            ASSERT_EQ(string.Find(t, start), at(model.find(m, from)));
            ASSERT_EQ(string.FindNoCase(t, start), at(small.find(smallText, from)));
            ASSERT_EQ(string.FindOneOf(t, start), at(model.find_first_of(m, from)));
            ASSERT_EQ(string.BeginsWith(t), model.starts_with(m));
            ASSERT_EQ(string.EndsWith(t), model.ends_with(m));
            ASSERT_EQ(string.BeginsWithNoCase(t), small.starts_with(smallText));
            ASSERT_EQ(string.EndsWithNoCase(t), small.ends_with(smallText));
            // The larger char32_t comes first, except without case.
            int order = Sign(kIsUCS4 ? m.compare(model) : model.compare(m));
            ASSERT_EQ(Sign(string.Compare(t)), order);
            ASSERT_EQ(Sign(string.Collate(t)), order);
            ASSERT_EQ((string > t) - (string < t), order);
            ASSERT_EQ(string == t, order == 0);
            ASSERT_EQ(Sign(string.CompareNoCase(t)), Sign(small.compare(smallText)));
        }
    }
}

TYPED_TEST(OxStringTest, SharesUntilWritten) {
    using String = OxStringT<TypeParam>;
    auto buffer = [](const String& string) { return static_cast<const TypeParam*>(string); };
    String a("abc"), b(a), x("x"), whole(a.Left(3)), mid(a.Mid(-2)), joined(a, 3ul);
    // Nothing to do: the buffer stays shared.
    EXPECT_EQ(a.Replace(x, b) + a.Replace('x', 'y') + a.Replace('a', 'a') + a.Remove('x'), 0);
    a.Trim().TrimLeft(x).TrimRight('x').TrimLength(3);
    for (const String* s : {&b, &whole, &mid, &joined}) EXPECT_EQ(buffer(*s), buffer(a));

    // Alone, the same buffer is edited in place, within its room.
    a.TrimLength(-1);
    const TypeParam* own = a;
    a = buffer(x);
    a += 'y';
    EXPECT_EQ(a, "xy");
    String moved(std::move(a));
    EXPECT_EQ(buffer(moved), own);
    // NOLINTNEXTLINE(bugprone-use-after-move): the rule under test
    EXPECT_EQ(buffer(a), String::m_EmptyString);
}

TYPED_TEST(OxStringTest, RawAccess) {
    using String = OxStringT<TypeParam>;
    String string("hello"), other(string), empty;
    TypeParam* raw = string.ObtainRaw(0);
    raw[0] = 'j';
    string.ReleaseRaw(0);
    EXPECT_EQ(other, "hello");
    EXPECT_EQ(string.ObtainRaw(5), raw);  // room enough
    EXPECT_NE(string.ObtainRaw(50), nullptr);
    EXPECT_EQ(string, "jello");    // the text moves along
    string.ReleaseRaw(ULONG_MAX);  // no further than the room
    EXPECT_EQ(string.GetLength(), 50);

    empty.ObtainRaw(0)[0] = 0;  // as a writer of empty text does
    empty.ReleaseRaw(0);
    TypeParam* buffer = empty.GetBuffer(4);
    EXPECT_NE(buffer, empty.GetBuffer(0));
    empty.SetStringLength(buffer, 0);
    empty.SetBuffer(buffer);
    EXPECT_EQ(static_cast<const TypeParam*>(empty), buffer);

    // No string is longer than kMaxStringLength.
    EXPECT_EQ(string.ObtainRaw(kMaxStringLength + 1), nullptr);
    EXPECT_EQ(string.ObtainRaw(ULONG_MAX), nullptr);
    if (sizeof(TypeParam) > 1) return;  // 4 GiB are too much to ask, even of memory not touched
    ASSERT_NE(string.ObtainRaw(kMaxStringLength / 2 + 1), nullptr);
    string.ReleaseRaw(ULONG_MAX);
    EXPECT_TRUE((string + string).IsEmpty());
    string += string;
    EXPECT_TRUE(string.IsEmpty());
}

TYPED_TEST(OxStringTest, ToleratesNull) {
    using String = OxStringT<TypeParam>;
    void* pointer = nullptr;
    String& null = reinterpret_cast<String&>(pointer);
    EXPECT_FALSE(null.IsValid());
    EXPECT_TRUE(null.IsEmpty() && null.IsUnique() && null == nullptr && null == String());
    EXPECT_TRUE(null.GetWord(2).IsEmpty() && null.GetLine(1).IsEmpty() && null.GetTab(0).IsEmpty());
    EXPECT_EQ(null.GetWordCount() + null.GetLineCount() + null.SpacesBeforeWord(3), 0);
    null.StripName();
    null.ReleaseRaw(3);
    EXPECT_EQ(null.ObtainRaw(0), String::m_EmptyString);
    String* volatile noObject = nullptr;  // or compilers warn
    EXPECT_FALSE(noObject->IsValid());

    // Null arguments.
    String text("ab");
    EXPECT_TRUE(text.BeginsWith(nullptr) && text.EndsWithNoCase(nullptr));
    EXPECT_TRUE(text.Compare(nullptr) == 1 && null.Compare(nullptr) == 0 && text != nullptr);
    EXPECT_EQ(text / nullptr + String(nullptr, text).Trim(nullptr), "ab/ab");
    EXPECT_EQ(text.Replace(String("b"), nullptr), 1);
    EXPECT_EQ(text += nullptr, "a");
}

TYPED_TEST(OxStringTest, LinesTabsAndWords) {
    using String = OxStringT<TypeParam>;
    String lines("a\r\nb\n\r\nc\r"), tabs("a\r\tb\t");
    const char* const expected[] = {"a", "a", "b", "", "c\r", "c\r"};
    for (int i = -1; i < 5; i++) EXPECT_EQ(lines.GetLine(i), expected[i + 1]) << i;
    EXPECT_EQ(String("\n123456789012").GetLine(0), "");
    EXPECT_EQ(String("a\n").GetLine(1), "");
    EXPECT_EQ(lines.GetLineCount() + String("a\n").GetLineCount(), 4 + 2);
    EXPECT_EQ(String("").GetLineCount() + String("").GetTabCount(), 0);
    EXPECT_EQ(tabs.GetTab(0), "a\r");
    EXPECT_EQ(tabs.GetTabCount(), 3);

    // Only a blank ends a word; other white space vanishes beside one and at the ends.
    String words("\t one\ttwo \t three\t b\v "), spaced("  a b   c ");
    const char* const expectedWords[] = {"one\ttwo", "one\ttwo", "three\t", "b", "b"};
    for (int i = -1; i < 4; i++) EXPECT_EQ(words.GetWord(i), expectedWords[i + 1]) << i;
    EXPECT_EQ(words.GetWordCount() + String(" \t ").GetWordCount(), 3);
    const int blanks[] = {2, 2, 3, 6, 7, 7};
    for (int i = -1; i < 5; i++) EXPECT_EQ(spaced.SpacesBeforeWord(i), blanks[i + 1]) << i;
    EXPECT_EQ(spaced.InterWordCount(), 7);
}

// ---- What differs between the widths

// Each form of text finds its own overload.
TEST(OxString, BuildsFromParts) {
    using String = OxStringT<char>;
    OxID id("id", true);
    String s("ab", "cd");
    EXPECT_STREQ(String(s, "efgh", 2ul) + String(nullptr, "x"), "abcdefx");
    EXPECT_STREQ("x" + String(s, s) / String("d"), "xabcdabcd/d");
    EXPECT_STREQ(String(s, 3ul) + String("x", s), "abcxabcd");
    EXPECT_STREQ(s + 'e' + String('f') + id + L"g" + OxStringT<char32_t>(U"h"), "abcdefidgh");
    s = id;
    s += id;
    s += U'i';
    EXPECT_STREQ(s, "ididi");
    s.Set(OxID());
    EXPECT_TRUE(s.IsEmpty());
    s = id;
    EXPECT_TRUE(s == id && OxID("c") != s && "id" == s && s == String("id") && s != "c");
    EXPECT_EQ(String("\xFF").GetChar(0), -1);
}

TEST(OxString, Formats) {
    OxStringT<char> s("start");
    s.CatF(" %d %s", 5, "x");
    s.PrintF("<%s|%s>", static_cast<const char*>(s), static_cast<const char*>(s) + 6);
    EXPECT_STREQ(s, "<start 5 x|5 x>");
    // Around the length up to which one formatting is enough, with the own text as argument.
    for (int length = 508; length < 516; length++) {
        std::string text = std::string(static_cast<size_t>(length) - 1, ' ') + "x";
        s.PrintF("%*s", length, "x");
        EXPECT_EQ(Content(s), text);
        s.ObtainRaw(3000);  // room to format in place, which must not happen
        s.PrintF("<%s>", static_cast<const char*>(s));
        s.CatF(",%s", static_cast<const char*>(s));
        EXPECT_EQ(Content(s), "<" + text + ">,<" + text + ">");
        OxStringT<wchar_t> wide;
        wide.PrintF(L"%*ls", length, L"x");
        EXPECT_EQ(wide.GetLength(), length);
        wide.CatF(L"%ls", static_cast<const wchar_t*>(wide));
        EXPECT_EQ(OxStringT<char>(wide), (text + text).c_str());
    }
    OxStringT<wchar_t> wide;
    wide.PrintF(L"%*d", 32768, 1);
    EXPECT_EQ(wide.GetLength(), 32768);
    wide.PrintF(L"%*d", 32769, 1);
    EXPECT_TRUE(wide.IsEmpty());
    OxStringT<char32_t> ucs4(U"text");
    ucs4.CatF(U"%d", 1);
    EXPECT_TRUE(ucs4.IsEmpty());
}

TEST(OxString, ConvertsBetweenAllWidths) {
    const unsigned short utf16[] = {'a', 0xDF, 0x20AC, 0xD83D, 0xDE00, 'z', 0};
    auto check = [](const auto& text) {
        OxStringT<char> narrow(text);
        OxStringT<wchar_t> wide(text);
        OxStringT<char32_t> ucs4(text);
        EXPECT_TRUE(narrow == "aß€😀z" && wide == L"aß€😀z" && ucs4 == U"aß€😀z");
        EXPECT_TRUE(ucs4.ToANSI() == narrow && wide.ToUTF8() == narrow &&
                    narrow.FromANSI() == wide);
    };
    check("aß€😀z");
    check(L"aß€😀z");
    check(U"aß€😀z");
    check(&utf16[0]);
    check(OxStringT<wchar_t>(L"aß€") + "😀z");
    check(OxStringT<char32_t>(utf16));

    // What cannot be converted leaves nothing, at whatever place it stands.
    OxStringT<char> narrow;
    for (const char* bad : {"\xC0\x80", "a\xC0\x80", "abcdefghijklmnop\xE2\x82", "\xFF"}) {
        OxStringT<wchar_t> wide(L"before");
        wide.FromUTF8(bad);
        narrow.FromUTF8(bad);
        EXPECT_TRUE(wide.IsEmpty());
        EXPECT_STREQ(narrow, bad);  // no conversion, no check
    }
    const unsigned short unpaired[] = {'a', 0xD83D, 'b', 0};
    for (auto* bad : {unpaired, static_cast<const unsigned short*>(nullptr)}) {
        OxStringT<char32_t> ucs4(U"before");
        ucs4 = bad;
        narrow = "before";
        narrow.FromUTF16(bad);
        EXPECT_TRUE(narrow.IsEmpty() && ucs4.IsEmpty());
    }
    EXPECT_TRUE(OxStringT<char>(static_cast<const wchar_t*>(nullptr)).IsEmpty());
}

TEST(OxString, SharesAcrossThreads) {
    OxStringT<char> mine("Text");
    auto work = [copy = mine]() mutable {
        for (int i = 0; i < 20000; i++) {
            OxStringT<char> longer(copy), upper(longer);
            longer += "!";
            upper.MakeUpper();
            ASSERT_STREQ(longer, "Text!");
        }
        copy.MakeUpper();  // whoever is last edits in place
        EXPECT_STREQ(copy, "TEXT");
    };
    std::thread first(work), second(std::move(work));
    mine.MakeLower();
    first.join();
    second.join();
    EXPECT_STREQ(mine, "text");
}

// ---- Text as people see it

TEST(OxString, OrdersNaturally) {
    // Numbers count behind an equal character only; a run of digits may have no end.
    const std::pair<const char*, const char*> inOrder[] = {
        {"x9", "x10"},         {"Name2", "nAME10"},
        {"a10b2", "a10b10"},   {"a1x", "a01y"},
        {"a", "ab"},           {"a-5", "a-6"},
        {"ä9", "ä10"},         {"10", "9"},
        {"a1", "a4294967297"}, {"a5", "a99999999999999999999999"}};
    for (auto [a, b] : inOrder) {
        EXPECT_LT(stricoll_smart(a, b), 0) << a << " " << b;
        EXPECT_GT(stricoll_smart(b, a), 0) << a << " " << b;
        EXPECT_LT(wcsicoll_smart(OxStringT<wchar_t>(a), OxStringT<wchar_t>(b)), 0) << a;
    }
    EXPECT_EQ(stricoll_smart("a01", "a1") + stricoll_smart("", nullptr), 0);
    EXPECT_EQ(stricoll_smart("a99999999999999999999999", "a88888888888888888888888"), 0);
    EXPECT_EQ(stricoll_smart("a2", "a10"), -8);
    EXPECT_LT(stricoll_smart(nullptr, "a"), 0);
}

TEST(OxString, StripsNamesToSymbols) {
    const std::string longName = std::string(300, ' ') + "ß 1";
    const std::string edge(256, 'x');  // what is converted without an allocation ends here
    const std::pair<const char*, const char*> cases[] = {
        {"My Name", "MyName"},   {"1st 2nd", "st2nd"},     {"_1-2.3", "_123"},
        {"Größe (x)", "Größex"}, {"日本 語", "日本語"},    {"!?", ""},
        {"a\xC0\x80\x62", ""},   {longName.c_str(), "ß1"}, {edge.c_str(), edge.c_str()}};
    for (auto [name, symbol] : cases) {
        OxStringT<char> string(name), shared(string);
        for (unsigned n = 1; FailsIn([&] { string.StripName(); }, n, false); n++, string = shared) {
            EXPECT_STREQ(string, "");
        }
        EXPECT_STREQ(string, symbol);
        EXPECT_EQ(Content(shared), name);
        OxID id(string = name);
        id.Strip();
        EXPECT_TRUE(id == symbol);
        OxStringT<char32_t> ucs4(name);
        ucs4.StripName();
        EXPECT_STREQ(ucs4.ToUTF8(), symbol);
    }
    OxID none;
    none.Strip();
    EXPECT_FALSE(none.IsValid());
    // An identifier's text must not look like a cell.
    EXPECT_STREQ(OxID(OxStringT<char>("\xFFxy")), "?xy");
}

TEST(CharGroups, MarksBelongToTheCharacterBefore) {
    const int offsets[] = {1, 2, 5, 6};
    CharGroups groups(U"\u0301ab\u0301\u0323c");
    ASSERT_EQ(groups.m_Count, 3);
    EXPECT_EQ(memcmp(groups.m_Offsets, offsets, sizeof(offsets)), 0);
    const char32_t noCharacters[] = {0x110000, 0x80000000, 0xFFFFFFFF, 0};
    EXPECT_EQ(CharGroups(noCharacters).m_Count + CharGroups(U"").m_Count, 3);
    OxStringT<char32_t> text(U"ab");
    std::optional<CharGroups> failed;
    if (!FailsIn([&] { failed.emplace(text); }, 1, true)) return;
    EXPECT_TRUE(!failed->m_Count && !failed->m_Offsets);
}

}  // namespace
}  // namespace Korvel

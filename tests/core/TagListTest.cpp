#include "core/TagList.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "ScriptValFakes.h"
#include "core/FaultsInternal.h"
#include "core/ScriptVal.h"
#include "core/TagMap.h"

namespace Korvel {
namespace {

using Test::MakeTable;
using Word = unsigned long long;

Word AsWord(const void* pointer) {
    return reinterpret_cast<Word>(pointer);
}

// Counts the living, and shows its number.
struct Counted : RefObject {
    explicit Counted(int number) : m_Number(number) { s_Alive++; }
    ~Counted() override { s_Alive--; }

    int m_Number;
    static inline std::atomic<int> s_Alive{0};
};

// A list as text: the items that a walk finds, without their tags' types.
std::string Show(const TagList& list) {
    std::string text;
    for (const Word* item = list.First(); item; item = list.Next(item)) {
        text += std::to_string(*item & 0xFF) + ":";
        switch (TypeOfTag(*item)) {
            case TAG_DOUBLE:
                text += std::to_string(TagList::GetDouble(item));
                break;
            case TAG_STRING:
            case TAG_ID: {
                OxID id = TagList::GetID(item);
                text += id.IsValid() ? static_cast<const char*>(id) : "null";
                break;
            }
            case TAG_OBJECT: {
                ptr<RefObject> object(TagList::GetObject(item));
                text += object ? std::to_string(static_cast<Counted&>(*object).m_Number) : "null";
                break;
            }
            case TAG_TAGLIST:
                text += TagList::GetTagList(item) ? "{" + Show(*TagList::GetTagList(item)) + "}"
                                                  : "null";
                break;
            default:
                text += std::to_string(static_cast<int>(TagList::GetLong(item)));
        }
        text += " ";
    }
    return text;
}

constexpr Word kInt = TAG_INT | 1, kDouble = TAG_DOUBLE | 2, kText = TAG_STRING | 3;
constexpr Word kObject = TAG_OBJECT | 4, kList = TAG_TAGLIST | 5, kID = TAG_ID | 6;
constexpr Word kPtr = TAG_PTR | 7;
constexpr Word kTags[] = {kInt,
                          kDouble,
                          kText,
                          kObject,
                          kList,
                          kID,
                          kInt | TAG_MULTI,
                          kText | TAG_MULTI,
                          kObject | TAG_MULTI};

TEST(TagList, WalksOverControlItems) {
    const Word tail[] = {kInt, 3, TAG_END};
    struct Case {
        std::vector<Word> tags;
        const char* items;
    };
    const Case cases[] = {
        {{TAG_END}, ""},
        {{kInt, 1, TAG_END, 0, kInt, 2, TAG_END}, "1:1 "},
        {{TAG_IGNORE, 9, kInt, 1, TAG_IGNORE, 0, TAG_END}, "1:1 "},
        {{TAG_SKIP, 1, kInt, 1, kInt, 2, TAG_END}, "1:2 "},
        {{TAG_SKIP, 2, TAG_SKIP, 5, TAG_MORE, 0, kInt, 2, TAG_END}, "1:2 "},  // they count as well
        {{TAG_SKIP, 9, kInt, 1, TAG_END}, ""},                                // past the end
        {{TAG_SKIP, 0xFFFFFFFF, kInt, 1, TAG_END}, "1:1 "},                   // below 0
        {{kInt, 1, TAG_MORE, AsWord(tail), kInt, 9, TAG_END}, "1:1 1:3 "},
        {{TAG_MULTI, 1, kInt, 1, TAG_END}, "1:1 "},  // no control tag that exists
    };
    for (const Case& c : cases) {
        TagList list(const_cast<Word*>(c.tags.data()), false);
        EXPECT_EQ(Show(list), c.items);
        EXPECT_EQ(list.IsEmpty(), c.tags[0] == TAG_END);
        list.Copy(0);
        EXPECT_EQ(Show(list), c.items);
        EXPECT_EQ(list.IsEmpty(), !*c.items);
    }
    EXPECT_TRUE(TagList(nullptr, true).IsEmpty());
}

TEST(TagList, GrowsByFourItemsAndKeepsItsArray) {
    TagList list(nullptr, true);
    list.Add(kInt, 0);
    const Word* first = list.First();
    for (int i = 1; i < 4; i++) list.Add(kInt | TAG_MULTI, i);
    EXPECT_EQ(list.First(), first);
    list.Add(kInt | TAG_MULTI, 4);
    EXPECT_EQ(Show(list), "1:0 1:1 1:2 1:3 1:4 ");
    first = list.First();
    list.Clear();
    EXPECT_TRUE(list.IsEmpty() && !list.First());
    for (int i = 0; i < 8; i++) {
        list.Add(kText | TAG_MULTI, "text");
        EXPECT_EQ(list.First(), first);
    }
}

TEST(TagList, ValuesTurnIntoWhatTheTagSays) {
    struct Case {
        Word tag;
        TagValue value;
        Word word;
    };
    double number = 2.5;
    Word bits;
    memcpy(&bits, &number, sizeof(bits));
    const Case cases[] = {
        {kInt, -1, 0xFFFFFFFF},  {kInt, 4000000000u, 4000000000},
        {kInt, true, 1},         {kInt, -2.9, 0xFFFFFFFE},
        {kInt, NAN, 0},          {kInt, 1e300, 0xFFFFFFFF},
        {kInt, 4294967297.0, 1}, {kDouble, 2.5, bits},
        {kDouble, 0, 0},         {kPtr, &number, AsWord(&number)},
        {kPtr, nullptr, 0},
    };
    for (const Case& c : cases) {
        TagList list;
        list.Set(c.tag, c.value, true);
        ASSERT_NE(list.First(), nullptr);
        EXPECT_EQ(list.First()[1], c.word) << &c - cases;
    }
    // What cannot be is not done; 0 is null.
    TagList list;
    list.Set(kDouble, -3, true);
    for (Word control : {TAG_END, TAG_MORE}) list.Add(control, nullptr);
    list.Set(kText, "text", true);
    list.Set(kText, 7, true);
    list.Set(kObject, "text", true);
    list.Set(kText | TAG_MULTI, false, true);
    EXPECT_EQ(Show(list), "2:-3.000000 3:text 3:null ");
}

TEST(TagList, ReadersGiveTheirDefaultForWhatIsAbsent) {
    TagList list, nested;
    ptr<Counted> object(new Counted(1));
    for (bool isThere : {false, true}) {
        EXPECT_EQ(list.FindQuery(kInt), isThere);
        EXPECT_EQ(list.GetInt(kInt, 1), isThere ? -5 : 1);
        EXPECT_EQ(list.GetLong(kInt, 1), isThere ? 0xFFFFFFFBu : 1u);
        EXPECT_EQ(list.GetBool(kInt, false), isThere);
        EXPECT_EQ(list.GetDouble(kDouble, 7), isThere ? 0.5 : 7);
        EXPECT_STREQ(list.GetString(kText, "def"), isThere ? "text" : "def");
        EXPECT_STREQ(list.GetSafeString(kText, nullptr), isThere ? "text" : "");
        EXPECT_STREQ(list.GetID(kID, "def"), isThere ? "id" : "def");
        EXPECT_TRUE((list.GetPtr(kPtr, nullptr) == &list) == isThere &&
                    (list.GetTagList(kList, &list) == &list) != isThere);
        ptr<RefObject> got(list.GetObject(kObject, object.Get()));
        EXPECT_TRUE(got.Get() == object.Get() && object->GetUseCount() == (isThere ? 3 : 2));
        int number[2] = {1, 1};  // 32 bits, by the tag's type
        EXPECT_EQ(list.Get(kInt, static_cast<void*>(number)), isThere);
        EXPECT_TRUE(number[0] == (isThere ? -5 : 1) && number[1] == 1);

        list.Add(kInt, -5);
        list.Add(kDouble, 0.5);
        list.Add(kText, OxStringT<char>("text"));
        list.Add(kObject, object.Get());
        list.Add(kList, &nested);
        list.Add(kID, OxID("id", true));
        list.Add(kPtr, &list);
    }
}

TEST(TagList, TakesPartsOfItself) {
    TagList list, nested;
    nested.Add(kInt, 1);
    list.Add(kText, "a");
    list.Add(kList, &nested);
    list.Set(kText, list.GetString(kText, nullptr), false);
    list.Set(list.Find(kList), list.GetTagList(kList, nullptr));
    list.Add(kInt | TAG_MULTI, 3);
    list.SetTags(&list, true);
    list.SetTags(nullptr, true);
    list.Set(nullptr, 3);
    list.Set(kList, &list, false);
    EXPECT_EQ(Show(list), "3:a 5:{3:a 5:{1:1 } 1:3 1:3 } 1:3 1:3 ");
    // A nested copy is built by setting, so that of equal tags the last one counts. What a borrowed
    // array points to need not stay.
    char id[] = "id";
    Word twice[] = {kInt, 1, kInt, 2, kID, AsWord(id), TAG_END};
    TagList borrowed(twice, false);
    nested.Set(kList, &borrowed, true);
    id[0] = 'x';
    EXPECT_EQ(Show(nested), "1:1 5:{1:2 6:id } ");
}

TEST(TagList, HoldsOneUseOfAnObject) {
    // One that is derived from something else first is still the object.
    struct Other {
        virtual ~Other() = default;
        int m_Number = 0;
    };
    struct Both : Other, Counted {
        Both() : Counted(8) {}
    };
    {
        ptr<Both> both(new Both);
        TagList list;
        for (Word tag : {kObject, kObject, kPtr}) list.Set(tag, both.Get(), true);
        EXPECT_EQ(list.GetPtr(kPtr, nullptr), both.Get());
        EXPECT_EQ(Show(list).substr(0, 4), "4:8 ");
        TagList copied(list.First(), true), borrowed(list.First(), false);
        EXPECT_EQ(both->GetUseCount(), 3);
    }
    EXPECT_EQ(Counted::s_Alive, 0);
}

bool LoadEmpty(TagList& list) {
    const unsigned char form[] = {4, 0, 0, 0, 0, 0, 0, 0};
    int size = sizeof(form);
    return list.Load(form, size);
}

// Its destructor asks the list from another thread, and hangs when the lock is held.
struct Asking : RefObject {
    explicit Asking(TagList& list) : m_List(list) {}
    ~Asking() override {
        std::thread([this] { m_List.Add(kInt | TAG_MULTI, 1); }).join();
    }
    TagList& m_List;
};

TEST(TagList, DropsObjectsOutsideOfItsLock) {
    TagList list;
    auto hold = [&](Word tag) {
        ptr<Asking> object(new Asking(list));
        list.Set(tag, object.Get(), true);
    };
    TagList other;
    other.Add(kObject, nullptr);

    hold(kObject);
    list.Set(kObject, nullptr, true);
    hold(kObject);
    list.Set(list.Find(kObject), nullptr);
    hold(kObject);
    list.SetTags(&other, true);
    EXPECT_EQ(Show(list), "4:null 1:1 1:1 1:1 ");
    hold(kObject | TAG_MULTI);
    list.Clear();
    EXPECT_EQ(Show(list), "1:1 ");  // added meanwhile
    hold(kObject);
    EXPECT_TRUE(LoadEmpty(list));
    EXPECT_EQ(Show(list), "1:1 ");
}

TEST(TagListReadOnly, NeverOwnsAnArray) {
    const Word tags[] = {kInt, 1, kText, AsWord("text"), TAG_END};
    TagListReadOnly list(const_cast<Word*>(tags), true);
    TagList other;
    other.Add(kPtr, &list);
    list.Copy(8);
    list.Add(kInt, 5);
    list.Set(kText | TAG_MULTI, "more", true);
    list.SetTags(&other, true);
    EXPECT_TRUE(list.First() == tags && Show(list) == "1:1 3:text ");
    EXPECT_FALSE(LoadEmpty(list));
    EXPECT_TRUE(list.IsEmpty());
}

TEST(TagList, Translates) {
    const Word one = AsWord("one"), two = AsWord("two"), own = AsWord("own");
    const Word tags[] = {TAG_TRANSLATE, 0,   kInt,       1, TAG_TRANSLATE, 0,  // behind no text
                         kText,         one, TAG_IGNORE, 0, TAG_TRANSLATE, 0, kText,  two,
                         TAG_TRANSLATE, own, kText,      0, TAG_TRANSLATE, 0, TAG_END};
    TagList list(const_cast<Word*>(tags), false);
    EXPECT_EQ(list.Translate("dom"), 3);
    EXPECT_EQ(list.First(), tags);
    g_Translate = [](const char* domain, const char* text, const char* comment, long long number) {
        EXPECT_TRUE(!comment && number == -1);
        return OxStringT<char>(domain) + "." + text;
    };
    EXPECT_EQ(TagListReadOnly(const_cast<Word*>(tags)).Translate("dom"), 3);
    EXPECT_EQ(list.Translate("dom"), 3);
    g_Translate = nullptr;
    EXPECT_EQ(Show(list), "0:null 1:1 0:null 1:one 3:dom.one 1:two 3:own.two 1:null 3:null ");
    EXPECT_STREQ(list.GetString(kText, nullptr), "dom.one");
    EXPECT_EQ(list.Translate("dom"), 0);
}

// Calls `act` with a value for the tag, and returns how that is shown.
template <class Act>
std::string WithValue(Word tag, int number, Act act) {
    const std::string digits = std::to_string(number), text = "t" + digits;
    TagList nested;
    nested.Add(kInt, number);
    ptr<Counted> object(new Counted(number));
    switch (TypeOfTag(tag)) {
        case TAG_DOUBLE:
            return act(number), digits + ".000000";
        case TAG_STRING:
        case TAG_ID:
            return act(text.c_str()), text;
        case TAG_OBJECT:
            return act(object.Get()), digits;
        case TAG_TAGLIST:
            return act(&nested), "{1:" + digits + " }";
        default:
            return act(number), digits;
    }
}

// What a list should hold: tags, and how their values are shown.
using Model = std::vector<std::pair<Word, std::string>>;

std::string Show(const Model& model) {
    std::string text;
    for (const auto& [tag, value] : model) text += std::to_string(tag & 0xFF) + ":" + value + " ";
    return text;
}

void Set(Model& model, Word tag, const std::string& value, bool add) {
    auto item = std::find_if(model.begin(), model.end(), [&](auto& i) { return i.first == tag; });
    if (item != model.end() && !(tag & TAG_MULTI)) {
        item->second = value;
    } else if (add) {
        model.emplace_back(tag, value);
    }
}

TEST(TagList, DoesAsASimpleModel) {
    std::mt19937 random(7);
    auto pick = [&](unsigned count) { return static_cast<int>(random() % count); };
    // Fills a list, with control items in between.
    auto fill = [&](TagList& list) {
        Model model;
        for (int i = pick(6); i > 0; i--) {
            Word tag = kTags[pick(9)];
            if (pick(4) == 0) list.Add(TAG_IGNORE, 77);
            for (Word control : {TAG_SKIP, TAG_IGNORE}) list.Add(control, 1);
            auto add = [&](const TagValue& value) { list.Add(tag, value); };
            model.emplace_back(tag, WithValue(tag, pick(1000), add));
        }
        return model;
    };
    for (int round = 0; round < 200; round++) {
        TagList source;
        Model model = fill(source);
        TagList list(source.First(), pick(2) != 0);
        ASSERT_EQ(Show(list), Show(model));
        list.Copy(pick(10));
        for (int step = 0; step < 40; step++) {
            Word tag = kTags[pick(9)];
            bool add = pick(3) != 0;
            int what = pick(20);
            if (what < 15) {
                std::string shown = WithValue(tag, pick(1000), [&](const TagValue& value) {
                    what < 12 ? list.Set(tag, value, add) : list.Add(tag, value);
                });
                what < 12 ? Set(model, tag, shown, add) : model.push_back({tag, shown});
            } else if (what < 17) {
                TagList other;
                Model more = fill(other);
                list.SetTags(&other, add);
                for (auto& [t, value] : more) Set(model, t, value, add);
            } else if (what == 17 && pick(4) == 0) {
                list.Clear();
                model.clear();
            } else if (what == 18) {
                list.Copy(pick(12) - 2);
            } else if (what == 19) {  // through bytes, which have no objects
                int size = 0;
                ASSERT_TRUE(list.Save(nullptr, size));
                std::vector<unsigned char> form(static_cast<size_t>(size));
                ASSERT_TRUE(list.Save(form.data(), size) && list.Load(form.data(), size));
                ASSERT_EQ(static_cast<size_t>(size), form.size());
                std::erase_if(model, [](auto& i) { return TypeOfTag(i.first) == TAG_OBJECT; });
            }
            ASSERT_EQ(Show(list), Show(model)) << round << ", " << what;
        }
    }
    EXPECT_EQ(Counted::s_Alive, 0);
}

using ByteForm = std::vector<unsigned char>;

ByteForm Bytes(std::initializer_list<uint32_t> words, const char* tail = "", size_t tailSize = 0) {
    ByteForm bytes(words.size() * 4 + tailSize);
    memcpy(bytes.data(), words.begin(), words.size() * 4);
    memcpy(bytes.data() + words.size() * 4, tail, tailSize);
    return bytes;
}

// True when the form is taken whole.
bool LoadAll(TagList& list, const ByteForm& form) {
    int size = static_cast<int>(form.size());
    return list.Load(form.data(), size) && size == static_cast<int>(form.size());
}

constexpr uint32_t kText32 = kText, kID32 = kID & 0xFFFFFFFF, kList32 = kList, kInt32 = kInt;

TEST(TagListBytes, AreExact) {
    TagList nested, list;
    nested.Add(kInt, 7);
    list.Add(kInt, -1);
    list.Add(kText, "abcd");
    list.Add(kText | TAG_MULTI, nullptr);
    list.Add(kPtr, &list);
    list.Add(kDouble, 0.0);
    list.Add(kList, &nested);
    list.Add(kID, OxID("abc", true));
    *list.FindNext(kPtr, nullptr) = TAG_IGNORE;
    auto expected = Bytes(
        {8 * 5 + 12 + 4, kInt32, 0xFFFFFFFF, kText32, 1, static_cast<uint32_t>(kText | TAG_MULTI),
         0, static_cast<uint32_t>(kDouble), 0, 0, kList32, 1, kID32, 1, 0},
        "\4\0\0\0abcd\f\0\0\0\1\0\0\x10\7\0\0\0\0\0\0\0\4\0\0\0abc", 32);
    const int whole = static_cast<int>(expected.size());
    int size = 0;
    ASSERT_TRUE(list.Save(nullptr, size) && size == whole);
    ByteForm form(expected.size(), 0xAA);
    size--;
    EXPECT_FALSE(list.Save(form.data(), size));
    EXPECT_TRUE(size == whole && form[0] == 0xAA);
    ASSERT_TRUE(list.Save(form.data(), size));
    EXPECT_EQ(form, expected);

    TagList loaded;
    loaded.Add(kText, "old");
    form.push_back(99);  // what follows belongs to somebody else
    size++;
    EXPECT_TRUE(loaded.Load(form.data(), size) && size == whole);
    EXPECT_EQ(Show(loaded), "1:-1 3:abcd 3:null 2:0.000000 5:{1:7 } 6:abc ");
    // Every shorter one is refused, wherever it ends.
    for (int shorter = -1; shorter < whole; shorter++) {
        ByteForm cut(form.begin(), form.begin() + std::max(shorter, 0));
        size = shorter;
        loaded.Add(kInt, 1);
        EXPECT_FALSE(loaded.Load(cut.data(), size));
        EXPECT_TRUE(loaded.IsEmpty() && size == shorter);
    }
}

TEST(TagListBytes, AreNotBelieved) {
    struct Case {
        ByteForm bytes;
        const char* items;  // null: refused
    };
    const uint32_t object = kObject, pointer = kPtr, huge = 0xFFFFFFFF;
    const Case cases[] = {
        {Bytes({4, 0}), ""},
        {Bytes({0}), nullptr},  // no end in the area
        {Bytes({8, kInt32, 5, 0}), nullptr},
        {Bytes({12, kInt32, 5, 0}), "1:5 "},
        {Bytes({20, 0, kInt32, 5, kInt32, 5}), ""},  // nothing behind the end
        {Bytes({12, 1, 5, 0}), nullptr},             // control items
        {Bytes({12, static_cast<uint32_t>(TAG_MULTI), 5, 0}), nullptr},
        {Bytes({28, object, 5, kInt32, 5, pointer, 5, 0}), "1:5 "},
        {Bytes({12, kText32, 2, 0, huge}), nullptr},
        {Bytes({12, kText32, 1, 0, 0}), "3: "},
        {Bytes({12, kText32, 1, 0, 2}, "\xFF\xFE", 2), "3:?\xFE "},
        {Bytes({12, kText32, 1, 0, 3}, "a\0b", 3), "3:a "},
        {Bytes({12, kID32, 1, 0, 0}), nullptr},
        {Bytes({12, kID32, 1, 0, 1}, "", 1), "6: "},
        {Bytes({12, kID32, 1, 0, 2}, "\xFFx", 2), "6:? "},
        {Bytes({12, kList32, 1, 0}), nullptr},
        {Bytes({12, kList32, 1, 0, 4, 1}), nullptr},
        {Bytes({20, kText32, 1, kList32, 1, 0, 1}, "a\4\0\0\0", 5), nullptr},
    };
    for (const Case& c : cases) {
        TagList list;
        int size = static_cast<int>(c.bytes.size());
        EXPECT_EQ(list.Load(c.bytes.data(), size), c.items != nullptr) << &c - cases;
        EXPECT_EQ(Show(list), c.items ? c.items : "") << &c - cases;
    }
    TagList list;
    int size = 100;
    EXPECT_FALSE(list.Load(nullptr, size));
}

TEST(TagListBytes, NestToADepthOf64) {
    TagList list;
    ByteForm form = Bytes({4, 0});
    const ByteForm level = Bytes({12, kList32, 1, 0});
    for (int depth = 0; depth <= 65; depth++) {
        int size = 0;
        EXPECT_EQ(list.Save(nullptr, size), depth <= 64) << depth;
        TagList loaded;
        EXPECT_EQ(LoadAll(loaded, form), depth <= 64);
        EXPECT_EQ(Show(loaded), depth <= 64 ? Show(list) : "");
        TagList outer;
        outer.Add(kList, &list);
        list.Clear();
        list.SetTags(&outer, true);
        form.insert(form.begin(), level.begin(), level.end());
    }
}

#ifdef KORVEL_FAULTS
// Whatever allocation fails, a write takes place or does not.
TEST(TagList, StaysWholeWhereMemoryRunsOut) {
    TagList source, nested;
    nested.Add(kText, "inner");
    source.Add(kText, "text");
    source.Add(kList, &nested);
    source.Add(kID, "id");
    ByteForm form(200);
    int size = 200;
    ASSERT_TRUE(source.Save(form.data(), size));
    form.resize(static_cast<size_t>(size));
    const std::string whole = Show(source);
    unsigned count = 1;
    for (unsigned n = 1; n <= count; n++) {
        Word tags[] = {kText, AsWord("text"), kList, AsWord(&nested), kID, AsWord("id"), TAG_END};
        TagList borrowed(tags, false), fresh, target, loaded;
        target.Add(kText, "old");
        target.Add(kID, "old");
        Faults::FailAt(n, false);
        borrowed.Copy(2);
        fresh.SetTags(&source, true);
        target.Set(kText, "new", true);
        target.Set(kID, "new", true);
        bool isLoaded = LoadAll(loaded, form);
        count = Faults::Stop();
        EXPECT_EQ(Show(borrowed), whole);
        EXPECT_EQ(whole.find(Show(fresh)), 0u) << Show(fresh);
        std::string shown = Show(target);
        EXPECT_TRUE(shown == "3:new 6:new " || shown == "3:old 6:new " || shown == "3:new 6:old ");
        EXPECT_EQ(Show(loaded), isLoaded ? whole : "");
    }
    EXPECT_GT(count, 15u);
}
#endif

// Two lists that take from each other, and readers of both.
TEST(TagList, WorksOnManyThreads) {
    TagList lists[2];
    ptr<Counted> object(new Counted(1));
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; t++) {
        threads.emplace_back([&, t] {
            TagList& own = lists[t % 2];
            TagList& other = lists[1 - t % 2];
            for (int i = 0; i < 1000; i++) {
                own.Set(kText, "text", true);
                own.Set(kObject, object.Get(), true);
                own.Set(kID, own.GetID(kID, "id"), true);
                other.SetTags(&own, true);
                ptr<RefObject> got(own.GetObject(kObject, nullptr));
                int size = 0;
                own.Save(nullptr, size);
                if (i % 50 == 0) own.Clear();
            }
        });
    }
    for (std::thread& thread : threads) thread.join();
    for (TagList& list : lists) list.Clear();
    EXPECT_EQ(object->GetUseCount(), 1);
}

TEST(TagMap, TurnsTablesIntoLists) {
    static const TagEnum colours = {0, "Colour", {{3, "red"}, {0x1FFFFFFFF, "none"}, {0, nullptr}}};
    constexpr Word kEnum = TAG_INT | 8, kBool = TAG_INT | 9;
    const TagMapEntry map[] = {
        {"Int", kInt, TAGMAP_Plain, nullptr, nullptr},
        {"Double", kDouble, TAGMAP_Plain, nullptr, nullptr},
        {"Text", kText, TAGMAP_Plain, nullptr, nullptr},
        {"ID", kID, TAGMAP_Plain, nullptr, nullptr},
        {"Ptr", kPtr, TAGMAP_Plain, nullptr, nullptr},
        {"Bool", kBool, TAGMAP_Bool, nullptr, nullptr},
        {"Enum", kEnum, TAGMAP_Enum, &colours, nullptr},
        {"Multi", kInt | TAG_MULTI, TAGMAP_Plain, nullptr, nullptr},
        {"Object", kObject, TAGMAP_Object, "Class", nullptr},
        {nullptr, 0, 0, nullptr, nullptr},
    };
    struct Case {
        ScriptVal values;
        const char* items;
    };
    const Case cases[] = {
        {MakeTable({{"Int", 4294967298.0}, {"Double", "0.5"}, {"Text", 1e20}}),
         "1:2 2:0.500000 3:1e+20 "},
        {MakeTable({{"ID", "id"}, {"Bool", 0.5}, {"Enum", "none"}}), "6:id 9:1 8:-1 "},
        {MakeTable({{"Int", "12.9x"}, {"ID", 5}, {"Bool", "true"}}), "1:12 6:null 9:0 "},
        {MakeTable({{"Int", true}, {"int", 1}, {"Ptr", 5}, {"Object", "x"}}), ""},
        {MakeTable({{"Bool", ScriptVal()}, {"Enum", "Red"}}), ""},
        {MakeTable({{"Enum", 3}}), ""},
        {5, ""},
    };
    TagList list;
    for (const Case& c : cases) {
        list.Clear();
        scriptval_maptags(map, true, c.values, list);
        EXPECT_EQ(Show(list), c.items) << &c - cases;
    }

    // Tables at 1 and 2 add to the same list, 4 comes after a gap; then 100,000 in one another.
    ScriptVal deep, values = MakeTable({{NAN, MakeTable()}, {"Multi", 7}});
    for (int key : {4, 2, 1, 0, -1}) values[key] = MakeTable({{"Multi", key}});
    values[2][1] = MakeTable({{"Multi", 21}});
    list.Clear();
    scriptval_maptags(map, true, values, list);
    EXPECT_EQ(Show(list), "1:7 1:1 1:2 1:21 ");
    for (int depth = 0; depth < 100000; depth++) {
        ScriptVal outer(SV_Table, nullptr);
        outer[1] = std::move(deep);
        deep = std::move(outer);
    }
    list.Clear();
    scriptval_maptags(map, true, deep, list);
    scriptval_maptags(map, false, values, list);
    scriptval_maptags(nullptr, true, values, list);
    EXPECT_TRUE(list.IsEmpty());
}

TEST(MapTag, CopiesWhatIsInside) {
    MapTag copy;
    {
        MapTag rows("Rows", kInt, {MapNumber("x", kDouble), MapTag("In", 1, {MapString("s", 2)})});
        MapTag other(MapBoolean("b", 3));
        other = rows;
        rows = rows.sub[1];  // out of itself
        EXPECT_EQ(rows.sub[0].type, SV_String);
        copy = other;
    }
    ASSERT_TRUE(copy.count == 2 && copy.type == SV_Table && copy.sub[1].count == 1);
    EXPECT_STREQ(copy.sub[1].sub[0].name, "s");
    EXPECT_TRUE(copy.sub[0].tag == kDouble && !copy.sub[0].sub);
}

}  // namespace
}  // namespace Korvel

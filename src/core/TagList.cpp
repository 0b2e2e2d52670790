#include "core/TagList.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <utility>

#include "core/NumbersInternal.h"
#include "core/ScriptVal.h"
#include "core/TextCellInternal.h"

namespace Korvel {
namespace {

using Word = unsigned long long;

constexpr int kGrowth = 8;  // words: four items; long lists grow by a quarter

// True for values that stand for something outside of the list.
bool IsReference(Word tag) {
    Word type = TypeOfTag(tag);
    return type == TAG_STRING || type == TAG_OBJECT || type == TAG_TAGLIST || type == TAG_ID;
}

bool MayBeAdded(Word tag) {
    return TypeOfTag(tag) != TAG_CONTROL || tag == TAG_IGNORE;
}

// Values of 0 and 1 are no pointers: null, and what the byte form makes of one.
bool IsPointer(Word word) {
    return word > 1;
}

template <class T>
T* AsPointer(Word word) {
    return reinterpret_cast<T*>(word);
}
Word AsWord(const void* pointer) {
    return reinterpret_cast<Word>(pointer);
}

Word ValueOf(const Word* item) {
    return item ? item[1] : 0;
}

// The item here, or behind the control items that stand here; null at the end.
Word* Walk(Word* item) {
    while (TypeOfTag(*item) == TAG_CONTROL) {
        switch (*item) {
            case TAG_END:
                return nullptr;
            case TAG_MORE:
                item = AsPointer<Word>(item[1]);
                if (!item) return nullptr;
                break;
            case TAG_SKIP: {
                int32_t pairs = static_cast<int32_t>(item[1]);
                item += 2;
                for (; pairs > 0 && *item != TAG_END; pairs--) item += 2;
                break;
            }
            default:
                item += 2;
        }
    }
    return item;
}

char* NewText(const char* text, size_t length) {
    char* copy = static_cast<char*>(g_ReusePoolMgr.Alloc(length + 1));
    if (!copy) return nullptr;
    memcpy(copy, text, length);
    copy[length] = 0;
    copy[0] = TextCell::SafeFirstByte(copy[0]);
    return copy;
}

}  // namespace

constinit const Word TagList::EmptyTags[1] = {TAG_END};

TagValue::TagValue(const OxID& id) : m_Kind(Kind::Text) {
    static_assert(sizeof(id) == sizeof(m_Pointer));
    memcpy(&m_Pointer, &id, sizeof(m_Pointer));
}

TagList::TagList() {
    Reset();
}
TagList::TagList(Word* tags, bool copy) {
    Init(tags, copy);
}
TagList::~TagList() {
    if (!m_Owned) return;
    DropItems();
    g_ReusePoolMgr.Free(m_Tags);
}

void TagList::Init(Word* tags, bool copy) {
    Reset();
    if (tags) m_Tags = m_End = tags;
    if (copy) Copy(kGrowth);
}

void TagList::Reset() {
    m_Owned = false;
    m_Tags = m_End = const_cast<Word*>(EmptyTags);  // nobody writes to an end
    m_Free = 0;
}

bool TagList::SetAttrsTagList(const TagList& tags) {
    SetTags(&tags, true);
    return true;
}

// Turns a value of another array into one of ours. False, with the word as it was, without memory.
bool TagList::CopyValue(Word tag, Word& word) {
    if (!IsPointer(word)) return true;
    switch (TypeOfTag(tag)) {
        case TAG_STRING: {
            const char* text = AsPointer<const char>(word);
            char* copy = NewText(text, strlen(text));
            if (!copy) return false;
            word = AsWord(copy);
            break;
        }
        case TAG_OBJECT:
            AsPointer<RefObject>(word)->Use();
            break;
        case TAG_TAGLIST: {
            TagList* copy = new TagList;
            if (!copy) return false;
            if (!copy->SetAll(*AsPointer<TagList>(word), true)) {
                delete copy;
                return false;
            }
            word = AsWord(copy);
            break;
        }
        case TAG_ID: {
            // A plain text in a borrowed array need not outlive it.
            const char* cell = TextCell::UseOrCopy(AsPointer<const char>(word));
            if (!cell) return false;
            word = AsWord(cell);
            break;
        }
        default:
            break;
    }
    return true;
}

// A value of ours from what SetData is given. False without memory.
bool TagList::MakeValue(Word tag, const void* data, Word& word) {
    word = 0;
    if (!data) return true;
    if (TypeOfTag(tag) == TAG_STRING) data = TextCell::Text(static_cast<const char*>(data));
    if (IsReference(tag)) {
        word = AsWord(data);
    } else {
        memcpy(&word, data, sizeof(word));
    }
    return CopyValue(tag, word);
}

// Gives back what a value stands for; this may run host code.
void TagList::DropValue(Word tag, Word word) {
    if (!IsPointer(word)) return;
    switch (TypeOfTag(tag)) {
        case TAG_STRING:
            g_ReusePoolMgr.Free(AsPointer<void>(word));
            break;
        case TAG_OBJECT:
            AsPointer<RefObject>(word)->Recycle();
            break;
        case TAG_TAGLIST:
            delete AsPointer<TagList>(word);
            break;
        case TAG_ID:
            TextCell::Drop(AsPointer<const char>(word));
            break;
        default:
            break;
    }
}

// Empties an array of the list's own. Nobody else may see the list.
void TagList::DropItems() {
    for (Word* item = m_Tags; item < m_End; item += 2) DropValue(item[0], item[1]);
    m_Free += static_cast<int32_t>(m_End - m_Tags);
    m_End = m_Tags;
    *m_End = TAG_END;
}

bool TagList::OwnsLocked(const Word* item) const {
    return m_Owned && item >= m_Tags && item < m_End;
}

void TagList::SwapLocked(TagList& other) {
    std::swap(m_Owned, other.m_Owned);
    std::swap(m_Tags, other.m_Tags);
    std::swap(m_End, other.m_End);
    std::swap(m_Free, other.m_Free);
}

// Gives this new list the items of another, without control items. With `move` what that list owns
// changes hands; all else is copied. False, with the other as it was, without memory.
bool TagList::BuildLocked(const TagList& from, bool move, int spare) {
    size_t count = 0;
    for (Word* item = from.First(); item; item = from.Next(item)) count++;
    size_t room = 2 * count + static_cast<size_t>(spare > 0 ? spare : 0);
    Word* words = static_cast<Word*>(g_ReusePoolMgr.Alloc((room + 1) * sizeof(Word)));
    if (!words) return false;
    m_Owned = true;
    m_Tags = m_End = words;
    m_Free = static_cast<int32_t>(room);
    *m_End = TAG_END;

    bool isDone = true;
    for (Word* item = from.First(); item && isDone; item = from.Next(item)) {
        Word word = item[1];
        isDone = (move && from.OwnsLocked(item)) || CopyValue(item[0], word);
        if (isDone) AppendLocked(item[0], word);
    }
    // What has moved stands in both arrays; one of them forgets it.
    Word* own = m_Tags;
    for (Word* item = from.First(); move && own < m_End; item = from.Next(item), own += 2) {
        if (from.OwnsLocked(item)) *(isDone ? item : own) = TAG_IGNORE;
    }
    return isDone;
}

void TagList::Copy(int spare) {
    TagList old;
    AutoTagListLock guard(*this);
    if (old.BuildLocked(*this, true, spare)) SwapLocked(old);
}

void TagList::Clear() {
    TagList old;
    {
        AutoTagListLock guard(*this);
        SwapLocked(old);
    }
    if (!old.m_Owned) return;
    old.DropItems();
    AutoTagListLock guard(*this);
    if (m_Tags == EmptyTags) SwapLocked(old);
}

bool TagList::IsEmpty() const {
    AutoTagListLock guard(*this);
    return *m_Tags == TAG_END;
}

Word* TagList::First() const {
    return Walk(m_Tags);
}
Word* TagList::Next(const Word* item) const {
    return item ? Walk(const_cast<Word*>(item) + 2) : First();
}

Word* TagList::FindNext(Word tag, const Word* item) const {
    Word* found = Next(item);
    while (found && *found != tag) found = Next(found);
    return found;
}
Word* TagList::Find(Word tag) const {
    return FindNext(tag, nullptr);
}

bool TagList::FindQuery(Word tag) const {
    AutoTagListLock guard(*this);
    return Find(tag) != nullptr;
}

unsigned int TagList::GetLong(const Word* item) {
    return static_cast<unsigned int>(ValueOf(item));
}
bool TagList::GetBool(const Word* item) {
    return ValueOf(item) != 0;
}
double TagList::GetDouble(const Word* item) {
    return std::bit_cast<double>(ValueOf(item));
}
const char* TagList::GetString(const Word* item) {
    return AsPointer<const char>(ValueOf(item));
}
const char* TagList::GetSafeString(const Word* item) {
    const char* text = GetString(item);
    return text ? text : "";
}
OxID TagList::GetID(const Word* item) {
    return OxID(GetString(item));
}
TagList* TagList::GetTagList(const Word* item) {
    return AsPointer<TagList>(ValueOf(item));
}
void* TagList::GetPtr(const Word* item) {
    return AsPointer<void>(ValueOf(item));
}
RefObject* TagList::GetObject(const Word* item) {
    RefObject* object = AsPointer<RefObject>(ValueOf(item));
    if (object) object->Use();
    return object;
}

// Reads the value of the first item with a tag. The former content of `out` goes when the list is
// no longer locked.
template <class T>
static bool ReadFirst(const TagList& list, Word tag, T& out, T (*read)(const Word* item)) {
    T value{};
    {
        AutoTagListLock guard(list);
        const Word* item = list.Find(tag);
        if (!item) return false;
        value = read(item);
    }
    out = std::move(value);
    return true;
}

bool TagList::Get(Word tag, unsigned int& out) const {
    return ReadFirst(*this, tag, out, GetLong);
}
bool TagList::Get(Word tag, int& out) const {
    unsigned int bits;
    bool isThere = Get(tag, bits);
    if (isThere) out = static_cast<int>(bits);
    return isThere;
}
bool TagList::Get(Word tag, bool& out) const {
    return ReadFirst(*this, tag, out, GetBool);
}
bool TagList::Get(Word tag, double& out) const {
    return ReadFirst(*this, tag, out, GetDouble);
}
bool TagList::Get(Word tag, char*& out) const {
    return ReadFirst<char*>(*this, tag, out,
                            [](const Word* item) { return AsPointer<char>(ValueOf(item)); });
}
bool TagList::Get(Word tag, OxID& out) const {
    return ReadFirst(*this, tag, out, GetID);
}
bool TagList::Get(Word tag, TagList*& out) const {
    return ReadFirst(*this, tag, out, GetTagList);
}
bool TagList::Get(Word tag, RefObject*& out) const {
    return ReadFirst(*this, tag, out, GetObject);
}
bool TagList::Get(Word tag, void* out) const {
    if (TypeOfTag(tag) == TAG_ID) return Get(tag, *static_cast<OxID*>(out));
    AutoTagListLock guard(*this);
    const Word* item = Find(tag);
    if (!item) return false;
    uint32_t low = static_cast<uint32_t>(item[1]);
    if (TypeOfTag(tag) == TAG_INT) {
        memcpy(out, &low, sizeof(low));
    } else {
        memcpy(out, &item[1], sizeof(item[1]));
    }
    return true;
}

unsigned int TagList::GetLong(Word tag, unsigned int def) const {
    Get(tag, def);
    return def;
}
int TagList::GetInt(Word tag, int def) const {
    Get(tag, def);
    return def;
}
bool TagList::GetBool(Word tag, bool def) const {
    Get(tag, def);
    return def;
}
double TagList::GetDouble(Word tag, double def) const {
    Get(tag, def);
    return def;
}
const char* TagList::GetString(Word tag, const char* def) const {
    char* text;
    return Get(tag, text) ? text : def;
}
const char* TagList::GetSafeString(Word tag, const char* def) const {
    const char* text = GetString(tag, def);
    return text ? text : "";
}
OxID TagList::GetID(Word tag, const OxID& def) const {
    OxID id;
    return Get(tag, id) ? id : def;
}
void* TagList::GetPtr(Word tag, void* def) const {
    ReadFirst(*this, tag, def, GetPtr);
    return def;
}
TagList* TagList::GetTagList(Word tag, TagList* def) const {
    Get(tag, def);
    return def;
}
RefObject* TagList::GetObject(Word tag, RefObject* def) const {
    if (Get(tag, def) || !def) return def;
    def->Use();
    return def;
}

// What SetData is to be given for a value: the thing itself, or `word`, which then holds it. False
// for a value that the tag cannot hold.
bool TagList::Resolve(Word tag, const TagValue& value, Word& word, const void*& data) {
    using Kind = TagValue::Kind;
    Word type = TypeOfTag(tag);
    switch (value.m_Kind) {
        case Kind::Integer: {
            double number = static_cast<double>(value.m_Integer);
            word = type == TAG_DOUBLE ? std::bit_cast<Word>(number)
                                      : static_cast<uint32_t>(value.m_Integer);
            break;
        }
        case Kind::Double:
            word = type == TAG_INT ? Low32(value.m_Number) : std::bit_cast<Word>(value.m_Number);
            break;
        case Kind::Pointer:
            word = AsWord(value.m_Pointer);
            break;
        case Kind::Text:
            word = AsWord(TextCell::Text(static_cast<const char*>(value.m_Pointer)));
    }
    if (type == TAG_INT) word = static_cast<uint32_t>(word);
    data = &word;
    if (!IsReference(tag)) return true;

    bool isPointer =
        value.m_Kind == Kind::Pointer || (value.m_Kind == Kind::Text && type != TAG_OBJECT);
    data = nullptr;
    if (!isPointer) return word == 0;
    data = value.m_Pointer;
    if (value.m_Object && type == TAG_OBJECT) data = value.m_Object;
    if (value.m_Object && type == TAG_TAGLIST) {
        data = dynamic_cast<const TagList*>(value.m_Object);
    }
    return true;
}

void TagList::Set(Word tag, const TagValue& value, bool add) {
    Word word = 0;
    const void* data = nullptr;
    if (Resolve(tag, value, word, data)) SetData(tag, data, add);
}
void TagList::Set(Word* item, const TagValue& value) {
    Word word = 0;
    const void* data = nullptr;
    if (item && Resolve(*item, value, word, data)) SetData(item, data);
}
void TagList::Add(Word tag, const TagValue& value) {
    Word word = 0;
    const void* data = nullptr;
    if (Resolve(tag, value, word, data)) AddData(tag, data);
}

void TagList::SetData(Word tag, const void* data, bool add) {
    bool isMulti = (tag & TAG_MULTI) != 0;
    add = add && MayBeAdded(tag);
    Word word;
    if ((isMulti && !add) || !MakeValue(tag, data, word)) return;
    {
        AutoTagListLock guard(*this);
        Word* item = isMulti ? nullptr : Find(tag);
        if (item) {
            std::swap(item[1], word);
        } else if (add && AppendLocked(tag, word)) {
            return;
        }
    }
    DropValue(tag, word);
}

void TagList::SetData(Word* item, const void* data) {
    if (!item) return;
    Word tag = *item;
    Word word;
    if (!MakeValue(tag, data, word)) return;
    {
        AutoTagListLock guard(*this);
        std::swap(item[1], word);
    }
    DropValue(tag, word);
}

void TagList::AddData(Word tag, const void* data) {
    Word word;
    if (!MayBeAdded(tag) || !MakeValue(tag, data, word)) return;
    bool isDone;
    {
        AutoTagListLock guard(*this);
        isDone = AppendLocked(tag, word);
    }
    if (!isDone) DropValue(tag, word);
}

// Takes the value over, unless it returns false.
bool TagList::AppendLocked(Word tag, Word word) {
    if (m_Free < 2) Copy(std::max(kGrowth, static_cast<int>((m_End - m_Tags) / 8) * 2));
    if (m_Free < 2) return false;
    m_Free -= 2;
    m_End[1] = word;
    m_End[2] = TAG_END;
    m_End[0] = tag;  // last, so that the list always ends
    m_End += 2;
    return true;
}

void TagList::SetTags(const TagList* other, bool add) {
    if (other) SetAll(*other, add);
}

// Gives each tag that stands in this private array more than once, but for those that may, its last
// value in its first place. Lists from bytes may be long, so it sorts. False without memory.
bool TagList::JoinRepeated() {
    size_t count = static_cast<size_t>(m_End - m_Tags) / 2;
    if (count < 2) return true;
    Word** items = static_cast<Word**>(g_ReusePoolMgr.Alloc(count * sizeof(Word*)));
    if (!items) return false;
    for (size_t i = 0; i < count; i++) items[i] = m_Tags + 2 * i;
    std::sort(items, items + count, [](Word* a, Word* b) { return *a != *b ? *a < *b : a < b; });
    Word* first = items[0];
    for (size_t i = 1; i < count; i++) {
        Word* item = items[i];
        Word tag = *item;
        if (tag != *first || tag & TAG_MULTI) {
            first = item;
            continue;
        }
        std::swap(first[1], item[1]);
        *item = TAG_IGNORE;
        DropValue(tag, item[1]);
    }
    g_ReusePoolMgr.Free(items);
    return true;
}

// False when not all could be set. The two lists are never locked together: what this one is to
// hold is copied first, and what it held goes with the copy.
bool TagList::SetAll(const TagList& other, bool add) {
    constexpr Word kIsSet = Word{1} << 63;  // in the copy: the item holds what this list held
    TagList copy;
    {
        AutoTagListLock guard(other);
        if (!copy.BuildLocked(other, false, 0)) return false;
    }
    if (!copy.JoinRepeated()) return false;

    AutoTagListLock guard(*this);
    int absent = 0;  // words
    for (Word* item = copy.First(); item; item = copy.Next(item)) {
        if (Word* own = *item & TAG_MULTI ? nullptr : Find(*item)) {
            std::swap(own[1], item[1]);
            *item |= kIsSet;
        } else {
            absent += 2;
        }
    }
    if (!add || absent == 0) return true;
    if (m_Free < absent) Copy(absent);
    bool isDone = true;
    for (Word* item = copy.First(); item; item = copy.Next(item)) {
        if (*item & kIsSet) continue;
        if (AppendLocked(item[0], item[1])) {
            *item = TAG_IGNORE;
        } else {
            isDone = false;
        }
    }
    return isDone;
}

int TagList::Translate(const char* domain) {
    auto isToTranslate = [](const Word* item, const Word* text) {
        return *item == TAG_TRANSLATE && text && TypeOfTag(*text) == TAG_STRING;
    };
    int count = 0;
    for (Word *text = nullptr, *item = First(); item; text = item, item = Next(item)) {
        if (isToTranslate(item, text)) count++;
    }
    if (count == 0 || !g_Translate) return count;
    if (!m_Owned) Copy(0);
    if (!m_Owned) return count;

    for (Word *text = nullptr, *item = First(); item; text = item, item = Next(item)) {
        if (!isToTranslate(item, text)) continue;
        Word word = 0;
        if (const char* source = GetString(text)) {
            const char* ownDomain = GetString(item);
            OxStringT<char> translation =
                g_Translate(ownDomain ? ownDomain : domain, source, nullptr, -1);
            if (!MakeValue(TAG_STRING, static_cast<const char*>(translation), word)) continue;
        }
        std::swap(item[1], word);
        DropValue(TAG_STRING, word);
        *item = *text;
        *text = TAG_TRANSLATED;
    }
    return count;
}

TagListReadOnly::~TagListReadOnly() = default;

void TagListReadOnly::Copy(int) {}

}  // namespace Korvel

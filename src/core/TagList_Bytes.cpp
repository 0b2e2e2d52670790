// The byte form of tag lists, docs/taglist-bytes.md. It comes from files and the wire: nothing in
// it is believed.
#include <climits>
#include <cstring>
#include <memory>

#include "core/TagList.h"
#include "core/TextCellInternal.h"

namespace Korvel {
namespace {

using Word = unsigned long long;

// Objects and pointers mean nothing to another process.
bool IsSaved(Word tag) {
    return TypeOfTag(tag) != TAG_OBJECT && TypeOfTag(tag) != TAG_PTR;
}

bool HasExtraData(Word tag) {
    Word type = TypeOfTag(tag);
    return type == TAG_STRING || type == TAG_ID || type == TAG_TAGLIST;
}

bool HasExtraData(const Word* item) {
    return HasExtraData(*item) && item[1] > 1;  // 1 is no pointer
}

// Bytes on their way out: counted, and written as far as there is room.
class Output {
public:
    Output() = default;
    Output(unsigned char* data, int size) : m_At(data), m_Left(static_cast<size_t>(size)) {}

    void Put(const void* data, size_t size) {
        m_Total += size;
        if (size > m_Left) m_Left = 0;
        if (m_Left == 0) return;
        memcpy(m_At, data, size);
        m_At += size;
        m_Left -= size;
    }
    void Put(uint32_t number) { Put(&number, sizeof(number)); }

    uint64_t Total() const { return m_Total; }

private:
    unsigned char* m_At = nullptr;
    size_t m_Left = 0;
    uint64_t m_Total = 0;
};

// Bytes on their way in. Nothing is taken, and the result is false or null, when too few are left.
struct Input {
    const unsigned char* m_At;
    size_t m_Left;

    const unsigned char* Take(size_t size) {
        if (size > m_Left) return nullptr;
        const unsigned char* data = m_At;
        m_At += size;
        m_Left -= size;
        return data;
    }
    template <class T>
    bool Read(T& number) {
        const unsigned char* data = Take(sizeof(T));
        if (data) memcpy(&number, data, sizeof(T));
        return data != nullptr;
    }
};

}  // namespace

struct TagListBytes {
    static bool Write(const TagList& list, Output& out, int depth);
    static bool Read(TagList& list, Input& in, int depth);

private:
    static bool CountItems(Input items, int& count);
    static bool ReadExtraData(Word tag, Input& in, int depth, Word& value);
};

bool TagListBytes::Write(const TagList& list, Output& out, int depth) {
    if (depth > TagList::kMaxDepth) return false;
    AutoTagListLock guard(list);
    uint64_t area = sizeof(uint32_t);
    for (const Word* item = list.First(); item; item = list.Next(item)) {
        if (IsSaved(*item)) area += TypeOfTag(*item) == TAG_DOUBLE ? 12 : 8;
    }
    if (area > UINT32_MAX) return false;
    out.Put(static_cast<uint32_t>(area));

    for (const Word* item = list.First(); item; item = list.Next(item)) {
        if (!IsSaved(*item)) continue;
        out.Put(static_cast<uint32_t>(*item));
        if (TypeOfTag(*item) == TAG_DOUBLE) {
            out.Put(&item[1], sizeof(item[1]));
        } else {
            out.Put(HasExtraData(*item) ? HasExtraData(item) : static_cast<uint32_t>(item[1]));
        }
    }
    out.Put(static_cast<uint32_t>(TAG_END));

    for (const Word* item = list.First(); item; item = list.Next(item)) {
        if (!HasExtraData(item)) continue;
        if (TypeOfTag(*item) == TAG_TAGLIST) {
            if (!Write(*TagList::GetTagList(item), out, depth + 1)) return false;
            continue;
        }
        const char* text = TextCell::Text(TagList::GetString(item));
        size_t size = strlen(text) + (TypeOfTag(*item) == TAG_ID ? 1 : 0);
        if (size > INT_MAX) return false;
        out.Put(static_cast<uint32_t>(size));
        out.Put(text, size);
    }
    return true;
}

bool TagList::Save(unsigned char* data, int& size) const {
    int capacity = size;
    size = 0;
    AutoTagListLock guard(*this);
    Output measured;
    if (!TagListBytes::Write(*this, measured, 0) || measured.Total() > INT_MAX) return false;
    size = static_cast<int>(measured.Total());
    if (!data) return true;
    if (size > capacity) return false;
    Output out(data, size);
    // A nested list that somebody changes meanwhile is the reason to look again.
    return TagListBytes::Write(*this, out, 0) && out.Total() == measured.Total();
}

// The items up to the end, for which an array needs room. False when there is no end in the area,
// or a control item.
bool TagListBytes::CountItems(Input items, int& count) {
    for (count = 0;;) {
        uint32_t tag;
        if (!items.Read(tag)) return false;
        if (tag == TAG_END) return true;
        if (TypeOfTag(tag) == TAG_CONTROL) return false;
        if (!items.Take(TypeOfTag(tag) == TAG_DOUBLE ? 8 : 4)) return false;
        if (IsSaved(tag)) count++;
    }
}

bool TagListBytes::ReadExtraData(Word tag, Input& in, int depth, Word& value) {
    if (TypeOfTag(tag) == TAG_TAGLIST) {
        std::unique_ptr<TagList> list(new TagList);
        if (!list || !Read(*list, in, depth + 1)) return false;
        value = reinterpret_cast<Word>(list.release());
        return true;
    }
    uint32_t size;
    if (!in.Read(size)) return false;
    const unsigned char* bytes = in.Take(size);
    if (!bytes) return false;
    char *block, *text;
    if (TypeOfTag(tag) == TAG_ID) {
        if (size == 0) return false;
        size--;  // for its NUL, which the cell has
        block = TextCell::New(size);
        text = block + 1;
    } else {
        block = text = static_cast<char*>(g_ReusePoolMgr.Alloc(size + 1ul));
    }
    if (!block) return false;
    memcpy(text, bytes, size);
    text[size] = 0;
    text[0] = TextCell::SafeFirstByte(text[0]);
    value = reinterpret_cast<Word>(block);
    return true;
}

// Fills a new list.
bool TagListBytes::Read(TagList& list, Input& in, int depth) {
    uint32_t area;
    if (depth > TagList::kMaxDepth || !in.Read(area)) return false;
    const unsigned char* start = in.Take(area);
    int count;
    if (!start || !CountItems({start, area}, count)) return false;
    list.Copy(2 * count);
    if (list.m_Free < 2 * count) return false;

    Input items{start, area};
    for (;;) {
        uint32_t tag = TAG_END, number = 0;
        items.Read(tag);
        if (tag == TAG_END) return true;
        Word value = 0;
        if (TypeOfTag(tag) == TAG_DOUBLE) {
            items.Read(value);
        } else {
            items.Read(number);
            value = number;
        }
        if (!IsSaved(tag)) continue;
        if (HasExtraData(tag) && number != 0 && !ReadExtraData(tag, in, depth, value)) return false;
        if (!list.AppendLocked(tag, value)) {
            TagList::DropValue(tag, value);
            return false;
        }
    }
}

bool TagList::Load(const unsigned char* data, int& size) {
    TagList fresh;
    Input in{data, data && size > 0 ? static_cast<size_t>(size) : 0};
    if (!TagListBytes::Read(fresh, in, 0)) {
        Clear();
        return false;
    }
    AutoTagListLock guard(*this);
    if (!m_Owned) {  // asks whether the list may own an array at all
        Reset();
        Copy(0);
        if (!m_Owned) return false;
    }
    SwapLocked(fresh);
    size -= static_cast<int>(in.m_Left);
    return true;
}

}  // namespace Korvel

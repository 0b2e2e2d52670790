#include "core/TagMap.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "Platform/LocaleInternal.h"
#include "core/NumbersInternal.h"
#include "core/TagList.h"

namespace Korvel {
namespace {

// The number that a value is or that its text begins with. False for other values.
bool ReadNumber(const ScriptVal& value, double& number) {
    number = value.ToNumber();
    if (const char* text = value.ToString()) number = strtod_l(text, nullptr, Platform::CLocale());
    return value.IsNumber() || value.IsString();
}

// "%g" with a point, whatever the thread's locale.
void FormatNumber(double number, char* out, size_t size) {
    locale_t former = uselocale(Platform::CLocale());
    snprintf(out, size, "%g", number);
    uselocale(former);
}

void MapPlain(unsigned long long tag, const ScriptVal& value, TagList& out) {
    double number;
    switch (TypeOfTag(tag)) {
        case TAG_INT:
            if (ReadNumber(value, number)) out.Set(tag, Low32(number), true);
            break;
        case TAG_DOUBLE:
            if (ReadNumber(value, number)) out.Set(tag, number, true);
            break;
        case TAG_STRING:
            if (value.IsString()) out.Set(tag, value.ToString(), true);
            if (value.IsNumber()) {
                char text[32];
                FormatNumber(value.ToNumber(), text, sizeof(text));
                out.Set(tag, text, true);
            }
            break;
        case TAG_ID:
            out.Set(tag, value.ToString(), true);
            break;
        default:
            break;
    }
}

void MapEnum(const TagMapEntry& row, const ScriptVal& value, TagList& out) {
    const TagEnum* names = static_cast<const TagEnum*>(row.extra);
    if (!names || !value.IsString()) return;
    for (const TagEnum::Pair* pair = names->pairs; pair->name; pair++) {
        if (value == pair->name) {
            out.Set(row.tag, static_cast<unsigned int>(pair->value), true);
            return;
        }
    }
}

void MapRows(const TagMapEntry* map, const ScriptVal& table, TagList& out) {
    for (const TagMapEntry* row = map; row->name; row++) {
        const ScriptVal& value = table.FindKeyConst(row->name);
        if (!value.KeepMe()) continue;
        switch (row->type) {
            case TAGMAP_Plain:
                MapPlain(row->tag, value, out);
                break;
            case TAGMAP_Bool:
                out.Set(row->tag, value.IsNumber() ? value.ToNumber() != 0 : value.ToBoolean(),
                        true);
                break;
            case TAGMAP_Enum:
                MapEnum(*row, value, out);
                break;
            default:
                break;
        }
    }
}

// How far the walk has come in one table. Tables nest as deep as scripts like, so the tables above
// the present one wait in a chain and not on the stack.
struct Level : Reuser {
    Level(const ScriptVal& table, Level* above) : m_Table(table), m_Above(above) {}

    // The table at the next number key, if there is one: number keys ascend.
    const ScriptVal* NextTable() {
        while (m_Table.NextKey(m_Entry)) {
            if (!(m_Entry->m_Key.ToNumber(-1) >= m_Key)) continue;  // NaN may stand anywhere
            if (m_Entry->m_Key.ToNumber() > m_Key || !m_Entry->m_Value.IsTable()) return nullptr;
            m_Key++;
            return &m_Entry->m_Value;
        }
        return nullptr;
    }

    const ScriptVal& m_Table;
    TableEntry* m_Entry = nullptr;
    double m_Key = 1;
    Level* m_Above;
};

}  // namespace

void scriptval_maptags(const TagMapEntry* map, bool enable, const ScriptVal& table, TagList& out) {
    if (!enable || !map) return;
    MapRows(map, table, out);
    Level* level = new Level(table, nullptr);
    while (level) {
        if (const ScriptVal* inside = level->NextTable()) {
            MapRows(map, *inside, out);
            if (Level* below = new Level(*inside, level)) level = below;
        } else {
            delete std::exchange(level, level->m_Above);
        }
    }
}

MapTag::MapTag(const char* valueName, unsigned long long valueTag,
               std::initializer_list<MapTag> inside)
    : MapTag(SV_Table, valueName, valueTag) {
    CopyInside(inside.begin(), static_cast<uint32_t>(inside.size()));
}

MapTag::MapTag(const MapTag& other)
    : Reuser(other), type(other.type), tag(other.tag), name(other.name) {
    CopyInside(other.sub, other.count);
}

MapTag& MapTag::operator=(const MapTag& other) {
    MapTag copy(other);
    std::swap(type, copy.type);
    std::swap(tag, copy.tag);
    std::swap(name, copy.name);
    std::swap(count, copy.count);
    std::swap(sub, copy.sub);
    return *this;
}

MapTag::~MapTag() {
    delete[] sub;  // from the last to the first
}

void MapTag::CopyInside(const MapTag* from, uint32_t number) {
    sub = number ? new MapTag[number] : nullptr;
    if (!sub) return;
    count = number;
    for (uint32_t i = 0; i < number; i++) sub[i] = from[i];
}

}  // namespace Korvel

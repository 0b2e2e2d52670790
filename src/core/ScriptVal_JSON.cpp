// Values as JSON, by way of trees of cJSON.
#include <cjson/cJSON.h>

#include <algorithm>
#include <cmath>
#include <memory>

#include "core/ScriptText.h"
#include "core/ScriptValInternal.h"

namespace Korvel {
namespace {

struct DeleteTree {
    void operator()(cJSON* tree) const { cJSON_Delete(tree); }
};
using Tree = std::unique_ptr<cJSON, DeleteTree>;

struct FreeText {
    void operator()(char* text) const { cJSON_free(text); }
};

// What became of a value: it may have no form in JSON, in which case it is left out.
enum class Outcome { Made, None, Failed };

Outcome MakeTree(const ScriptVal& value, int depth, Tree& out);

// Adds what a table holds to an array, or to an object under its text keys.
bool AddEntries(const ScriptVal& table, int depth, cJSON* list) {
    if (depth >= kMaxNesting) return false;
    bool isArray = cJSON_IsArray(list);
    for (TableEntry* entry = Chain::Head(table); entry; entry = entry->m_Next) {
        const char* key = entry->m_Key.ToString();
        if (!isArray && !key) continue;
        Tree item;
        Outcome outcome = MakeTree(entry->m_Value, depth + 1, item);
        if (outcome == Outcome::None) continue;
        if (outcome == Outcome::Failed) return false;
        if (!(isArray ? cJSON_AddItemToArray(list, item.get())
                      : cJSON_AddItemToObject(list, key, item.get()))) {
            return false;
        }
        item.release();
    }
    return true;
}

Outcome MakeTree(const ScriptVal& value, int depth, Tree& out) {
    switch (value.Type()) {
        case SV_Nil:
            out.reset(cJSON_CreateNull());
            break;
        case SV_Number: {
            double number = value.ToNumber();
            out.reset(std::isfinite(number) ? cJSON_CreateNumber(number) : cJSON_CreateNull());
            break;
        }
        case SV_String:
            out.reset(cJSON_CreateString(value.ToString()));
            break;
        case SV_Boolean:
            out.reset(cJSON_CreateBool(value.ToBoolean()));
            break;
        case SV_Table: {
            bool isArray = Chain::FindNumber(value, 1) != nullptr;
            out.reset(isArray ? cJSON_CreateArray() : cJSON_CreateObject());
            if (out && !AddEntries(value, depth, out.get())) return Outcome::Failed;
            break;
        }
        default:
            return Outcome::None;
    }
    return out ? Outcome::Made : Outcome::Failed;
}

bool Read(const cJSON* item, int depth, ScriptVal& out);

// Texts of values may not begin with this byte.
bool IsText(const char* text) {
    return text && *text != TextCell::kMarker;
}

bool ReadText(const char* text, ScriptVal& out) {
    if (!IsText(text)) return false;
    out = text;
    return out.IsString();
}

bool ReadArray(const cJSON* array, int depth, ScriptVal& out) {
    int position = 0;
    for (const cJSON* item = array->child; item; item = item->next) {
        ScriptVal& value = out.FindKey(++position, SVF_Int, SVF_Int);
        if (IsInvalid(value) || !Read(item, depth + 1, value)) return false;
    }
    return true;
}

struct Field {
    const cJSON* m_Item;
    uint32_t m_Place;
};

// Of fields with one name the last one counts, at the place of the first: the others become null.
// Comparing each with all before it would take for ever where there are many.
void DropRepeated(Field* fields, const cJSON** items, uint32_t count) {
    std::sort(fields, fields + count, [](const Field& a, const Field& b) {
        int order = strcmp(a.m_Item->string, b.m_Item->string);
        return order != 0 ? order < 0 : a.m_Place < b.m_Place;
    });
    for (uint32_t first = 0, i = 1; i < count; i++) {
        if (strcmp(fields[i].m_Item->string, fields[first].m_Item->string) != 0) {
            first = i;
            continue;
        }
        items[fields[first].m_Place] = fields[i].m_Item;
        items[fields[i].m_Place] = nullptr;
    }
}

bool ReadObject(const cJSON* object, int depth, ScriptVal& out) {
    uint32_t count = 0;
    for (const cJSON* item = object->child; item; item = item->next) {
        if (!IsText(item->string)) return false;
        count++;
    }
    if (count == 0) return true;
    PoolBlock<void> block(g_ReusePoolMgr.Alloc(count * (sizeof(Field) + sizeof(const cJSON*))));
    if (!block) return false;
    auto* fields = static_cast<Field*>(block.get());
    auto* items = reinterpret_cast<const cJSON**>(fields + count);
    uint32_t place = 0;
    for (const cJSON* item = object->child; item; item = item->next, place++) {
        fields[place] = {item, place};
        items[place] = item;
    }
    DropRepeated(fields, items, count);
    for (place = 0; place < count; place++) {
        if (!items[place]) continue;
        ScriptVal key;
        if (!ReadText(items[place]->string, key)) return false;
        ScriptVal& value = out.AddKey(std::move(key));
        if (IsInvalid(value) || !Read(items[place], depth + 1, value)) return false;
    }
    return true;
}

// Into a nil.
bool Read(const cJSON* item, int depth, ScriptVal& out) {
    switch (item->type & 0xff) {
        case cJSON_NULL:
            return true;
        case cJSON_False:
        case cJSON_True:
            out = cJSON_IsTrue(item) != 0;
            return true;
        case cJSON_Number:
            if (std::isfinite(item->valuedouble)) out = item->valuedouble;
            return true;
        case cJSON_String:
            return ReadText(item->valuestring, out);
        case cJSON_Object:
        case cJSON_Array:
            if (depth >= kMaxNesting) return false;
            out = SV_Table;
            return cJSON_IsArray(item) ? ReadArray(item, depth, out) : ReadObject(item, depth, out);
        default:
            return false;
    }
}

// Such a byte would end a text early. Backslashes stand in strings only.
bool HasEscapedNul(const char* json) {
    while ((json = strchr(json, '\\')) != nullptr) {
        if (strncmp(json + 1, "u0000", 5) == 0) return true;
        json += json[1] ? 2 : 1;
    }
    return false;
}

}  // namespace

cJSON* TocJSON(const ScriptVal& value) {
    Tree tree;
    return MakeTree(value, 0, tree) == Outcome::Made ? tree.release() : nullptr;
}

bool FromcJSON(cJSON* item, ScriptVal& out) {
    ScriptVal value;
    if (!item || out.IsReadOnly() || !Read(item, 0, value)) return false;
    out = std::move(value);
    return true;
}

bool ScriptVal::ToJSON(OxStringT<char>& out) const {
    Tree tree(TocJSON(*this));
    if (!tree) return false;
    std::unique_ptr<char, FreeText> text(cJSON_Print(tree.get()));
    if (!text) return false;
    out = text.get();
    return !out.IsEmpty();  // no form of a value is
}

bool ScriptVal::FromJSON(const OxStringT<char>& text) {
    if (HasEscapedNul(text ? text : "")) return false;
    Tree tree(cJSON_Parse(text));
    return tree && FromcJSON(tree.get(), *this);
}

}  // namespace Korvel

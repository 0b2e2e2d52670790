#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>

#include "core/0ReusePool.h"
#include "core/Export.h"
#include "core/ScriptVal.h"

namespace Korvel {

class TagList;

// The names of a tag's values, as a static table: pairs up to one with a null name.
struct TagEnum {
    struct Pair {
        unsigned long long value;  // the low 32 bits count
        const char* name;
    };

    unsigned long long unused;
    const char* name;
    __extension__ Pair pairs[];
};

// What a row of a tag map says about its tag's value.
enum TagMapType : int32_t {
    TAGMAP_Plain = 1,  // as the tag's type says
    TAGMAP_Bool = 2,
    TAGMAP_Enum = 3,    // one of the names of a TagEnum
    TAGMAP_Object = 4,  // an object of the class that `extra` names
    TAGMAP_UInt = 5,
};

// The name of a tag, one row of a static table. A row with a null name ends the table.
struct TagMapEntry {
    const char* name;
    unsigned long long tag;
    int32_t type;       // a TagMapType
    const void* extra;  // a TagEnum, or the name of a class as text; else null
    const char* lua;    // more fields of the entry in Lua's table, or null
};

static_assert(offsetof(TagEnum, pairs) == 16 && sizeof(TagEnum::Pair) == 16);
static_assert(offsetof(TagMapEntry, type) == 16 && offsetof(TagMapEntry, extra) == 24 &&
              sizeof(TagMapEntry) == 40);

// Turns a script's table into items of a list: each row whose name is a key of the table sets its
// tag, adding what is absent. Then the tables at the keys 1, 2 and so on of the table, up to the
// first that is absent or no table, do the same to the same list. Values that a row cannot take are
// skipped:
//   Plain  TAG_INT, TAG_DOUBLE: a number, or a text that is read as one (0 when it is none)
//          TAG_STRING:          a text, or a number, written with "%g"
//          TAG_ID:              a text, anything else as null
//   Bool   a number is true unless it is 0; of the others only a boolean can be true
//   Enum   a text that is one of the names
// With `enable` false nothing happens. The map may be null.
KORVEL_EXPORT void scriptval_maptags(const TagMapEntry* map, bool enable, const ScriptVal& table,
                                     TagList& out);

// A named value for the tables of hosts: what type it has in a script, the tag that it becomes, and
// for tables the values inside, which it owns. The name is borrowed.
//
// Failure: where memory has run out there are no values inside.
struct KORVEL_EXPORT MapTag : Reuser {
    MapTag() = default;
    MapTag(ScriptValType valueType, const char* valueName, unsigned long long valueTag)
        : type(valueType), tag(valueTag), name(valueName) {}
    MapTag(const char* valueName, unsigned long long valueTag,
           std::initializer_list<MapTag> inside);
    MapTag(const MapTag& other);
    MapTag& operator=(const MapTag& other);
    ~MapTag();

    ScriptValType type = SV_Nil;
    unsigned long long tag = 0;
    const char* name = nullptr;
    uint32_t count = 0;
    MapTag* sub = nullptr;

private:
    void CopyInside(const MapTag* from, uint32_t number);
};

struct MapBoolean : MapTag {
    MapBoolean(const char* valueName, unsigned long long valueTag)
        : MapTag(SV_Boolean, valueName, valueTag) {}
};
struct MapNumber : MapTag {
    MapNumber(const char* valueName, unsigned long long valueTag)
        : MapTag(SV_Number, valueName, valueTag) {}
};
struct MapString : MapTag {
    MapString(const char* valueName, unsigned long long valueTag)
        : MapTag(SV_String, valueName, valueTag) {}
};

}  // namespace Korvel

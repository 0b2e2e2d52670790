// The C functions behind the metatables of Lua types. A script can call each of them with any
// arguments, so none believes that its first argument is what Lua itself would pass: see ToRecord.
// Plain Lua 5.1 reaches this source too, see LuaGuardInternal.h.
#include "runtime/lua/LuaType.h"

#include <cstring>
#include <lua.hpp>
#include <string_view>

#include "core/0ReusePool.h"
#include "runtime/lua/LuaGuardInternal.h"

namespace Korvel {

constinit _LuaType* g_LuaTypeList = nullptr;

namespace {

LuaFuncTable s_NoFunctions[1];
LuaMemberTable s_NoMembers[1];

// What a userdata points to. Its pointer is null once the record has been released.
struct LuaObjectRec : Reuser {
    LuaObjectRec(LuaType* type, void* object, unsigned int flags)
        : m_Type(type), m_Object(object), m_Flags(flags) {}

    LuaType* m_Type;
    void* m_Object;
    unsigned int m_Flags;
    bool m_HasFunctions = false;  // the userdata's environment remembers them by name
};

// What a name means on the objects of a type: a variable or a function.
struct Name {
    LuaType* m_Owner;  // in whose table it stands
    LuaMemberTable* m_Variable;
    LuaFuncTable* m_Function;
};

template <class Table>
void FillHashes(Table* table) {
    for (; table->m_Name; table++) table->m_Hash = gethash(table->m_Name);
}

template <class Table>
Table* Find(Table* table, std::string_view name, uint32_t hash) {
    for (; table->m_Name; table++) {
        if (table->m_Hash == hash && table->m_Name == name) return table;
    }
    return nullptr;
}

bool IsOneOf(LuaType* type, LuaType* kind) {
    while (type && type != kind) type = type->GetParent();
    return type != nullptr;
}

// Pops a metatable and tells whether it is a type's. The registry, where scripts cannot write,
// holds each type under its metatable, and the metatable under the type.
bool PopTypesMetatable(lua_State* L) {
    lua_rawget(L, LUA_REGISTRYINDEX);
    bool found = lua_touserdata(L, -1) != nullptr;
    lua_pop(L, 1);
    return found;
}

// The record of the value at `index`; null for all but a userdata of a type that still has it.
// There must be a free slot on the stack.
LuaObjectRec* ToRecord(lua_State* L, int index) {
    auto userdata = static_cast<LuaObjectRec**>(lua_touserdata(L, index));
    if (!userdata || !lua_getmetatable(L, index)) return nullptr;
    return PopTypesMetatable(L) ? *userdata : nullptr;
}

// The upvalues of a metatable's functions: the metatable, by which they know their own objects, and
// the names that scripts have looked up in the type's tables, with the Name of each.
constexpr int kMetatable = lua_upvalueindex(1);
constexpr int kNames = lua_upvalueindex(2);

// The record of argument 1, for a metatable's functions. Leaves the metatable on the stack.
LuaObjectRec* GetSelf(lua_State* L) {
    auto userdata = static_cast<LuaObjectRec**>(lua_touserdata(L, 1));
    if (!userdata || !lua_getmetatable(L, 1)) return nullptr;
    return lua_rawequal(L, -1, kMetatable) ? *userdata : nullptr;
}

// The same for a function with `count` more arguments, which begin at 1 then; what is missing is
// nil. The object goes behind them and not away, because the stack may be all that keeps it from
// being collected.
LuaObjectRec* TakeSelf(lua_State* L, int count) {
    LuaObjectRec* record = GetSelf(L);
    if (!record) return nullptr;
    lua_pop(L, 1);
    lua_settop(L, 1 + count);
    while (count-- > 0) lua_insert(L, 1);
    return record;
}

using Operation = int (LuaType::*)(lua_State*, void*, LuaType*);

int Operate(lua_State* L, const LuaObjectRec& record, Operation operation) {
    return CallOut(L, [&] {
        LuaType* type = record.m_Type;
        return (type->*operation)(L, type->lw_to_type(record.m_Object), type);
    });
}

int Operate(lua_State* L, Operation operation, int arguments) {
    LuaObjectRec* record = TakeSelf(L, arguments);
    return record ? Operate(L, *record, operation) : 0;
}

// The record of the value at `index` if it is of the type of that name.
LuaObjectRec* ToRecordOf(lua_State* L, int index, const char* name) {
    if (!name || !lua_checkstack(L, LUA_MINSTACK)) return nullptr;
    LuaObjectRec* record = ToRecord(L, index);
    if (!record || record->m_Type->FindType(name)) return record;
    int top = lua_gettop(L);
    lua_pushstring(L, name);
    bool isType = Operate(L, *record, &LuaType::lw_istypeof) > 0 && lua_isboolean(L, -1) &&
                  lua_toboolean(L, -1);
    lua_settop(L, top);
    return isType ? ToRecord(L, index) : nullptr;  // which lw_istypeof may have let go of
}

int luatype_call_typename(lua_State* L) {
    return Operate(L, &LuaType::lw_typename, 0);
}
int luatype_call_tostring(lua_State* L) {
    return Operate(L, &LuaType::lw_tostring, 0);
}
int luatype_call_add(lua_State* L) {
    return Operate(L, &LuaType::lw_add, 1);
}
int luatype_call_sub(lua_State* L) {
    return Operate(L, &LuaType::lw_sub, 1);
}
int luatype_call_mul(lua_State* L) {
    return Operate(L, &LuaType::lw_mul, 1);
}
int luatype_call_div(lua_State* L) {
    return Operate(L, &LuaType::lw_div, 1);
}
int luatype_call_pow(lua_State* L) {
    return Operate(L, &LuaType::lw_pow, 1);
}
int luatype_call_unm(lua_State* L) {
    return Operate(L, &LuaType::lw_unm, 1);
}
int luatype_call_eq(lua_State* L) {
    return Operate(L, &LuaType::lw_eq, 1);
}
int luatype_call_lt(lua_State* L) {
    return Operate(L, &LuaType::lw_lt, 1);
}
int luatype_call_le(lua_State* L) {
    return Operate(L, &LuaType::lw_le, 1);
}
int luatype_call_concat(lua_State* L) {
    return Operate(L, &LuaType::lw_concat, 1);
}

int luatype_call_istypeof(lua_State* L) {
    LuaObjectRec* record = TakeSelf(L, 1);
    if (!record) return 0;
    lua_pushvalue(L, 1);  // the name is to be on top
    return Operate(L, *record, &LuaType::lw_istypeof);
}

int luatype_call_call(lua_State* L) {
    LuaObjectRec* record = GetSelf(L);
    if (!record) return 0;
    lua_pop(L, 1);
    return Operate(L, *record, &LuaType::lw_call);
}

int luatype_call_gc(lua_State* L) {
    LuaObjectRec* record = GetSelf(L);
    if (!record) return 0;
    LuaObjectRec last = *record;
    *static_cast<LuaObjectRec**>(lua_touserdata(L, 1)) = nullptr;
    delete record;
    lua_settop(L, 0);
    return last.m_Flags & LWF_NoReference ? 0 : Operate(L, last, &LuaType::lw_recycle);
}

int luatype_call_create(lua_State* L) {
    auto type = static_cast<LuaType*>(lua_touserdata(L, lua_upvalueindex(1)));
    return CallOut(L, [&] { return type->lw_create(L); });
}

// A function of an object. Upvalues: the Name and the object's userdata.
int luatype_call_member(lua_State* L) {
    if (!lua_rawequal(L, 1, lua_upvalueindex(2))) {
        return luaL_error(L, "Member functions must be called with a ':', not a '.'");
    }
    auto record = *static_cast<LuaObjectRec**>(lua_touserdata(L, 1));
    if (!record) return 0;
    lua_remove(L, 1);
    auto name = static_cast<Name*>(lua_touserdata(L, lua_upvalueindex(1)));
    return CallOut(L, [&] {
        LuaType* owner = name->m_Owner;
        return name->m_Function->m_Function(owner, L, owner->lw_to_type(record->m_Object),
                                            record->m_Type);
    });
}

// Pushes a function of the object at 1, with the key at 2 and the Name on top of the stack. Each
// closure is made once; it refers to the userdata, so only the userdata may refer to it: the table
// that remembers them is the userdata's own environment.
int PushMemberFunction(lua_State* L, LuaObjectRec* record) {
    if (record->m_HasFunctions) {
        lua_getfenv(L, 1);
        lua_pushvalue(L, 2);
        lua_rawget(L, -2);
        if (!lua_isnil(L, -1)) return 1;
        lua_pop(L, 1);
    } else {
        lua_createtable(L, 0, 1);
        lua_pushvalue(L, -1);
        lua_setfenv(L, 1);
        record->m_HasFunctions = true;
    }
    lua_insert(L, -2);
    lua_pushvalue(L, 1);
    lua_pushcclosure(L, luatype_call_member, 2);
    lua_pushvalue(L, 2);
    lua_pushvalue(L, -2);
    lua_rawset(L, -4);
    return 1;
}

int CallVariable(lua_State* L, LuaObjectRec* record, const Name& name, bool set) {
    return CallOut(L, [&] {
        LuaType* owner = name.m_Owner;
        return name.m_Variable->m_Function(owner, L, owner->lw_to_type(record->m_Object),
                                           record->m_Type, set);
    });
}

// What the text at `index` means on an object of a type, to read it or to write it.
Name FindName(lua_State* L, int index, LuaType* type, bool set) {
    size_t length = 0;
    const char* text = lua_tolstring(L, index, &length);
    std::string_view name(text, length);
    uint32_t hash = gethash(text);
    for (; type; type = type->GetParent()) {
        LuaMemberTable* variable = Find(type->GetMembers(), name, hash);
        if (variable) return {type, variable, nullptr};
        LuaFuncTable* function = set ? nullptr : Find(type->GetFunctions(), name, hash);
        if (function) return {type, nullptr, function};
    }
    return {};
}

// Pushes the Name of the key at 2 and returns it; null when it has none. Only those that are found
// are remembered, so that a script cannot fill the memory with others.
Name* PushName(lua_State* L, LuaType* type) {
    lua_pushvalue(L, 2);
    lua_rawget(L, kNames);
    auto known = static_cast<Name*>(lua_touserdata(L, -1));
    if (known || lua_type(L, 2) != LUA_TSTRING) return known;
    Name found = FindName(L, 2, type, false);
    if (!found.m_Owner) return nullptr;
    auto name = static_cast<Name*>(lua_newuserdata(L, sizeof(Name)));
    *name = found;
    lua_pushvalue(L, 2);
    lua_pushvalue(L, -2);
    lua_rawset(L, kNames);
    return name;
}

int luatype_call_index(lua_State* L) {
    if (lua_gettop(L) < 2) lua_settop(L, 2);
    LuaObjectRec* record = GetSelf(L);
    if (!record) return 0;
    Name* name = PushName(L, record->m_Type);
    if (name && name->m_Function) return PushMemberFunction(L, record);
    lua_settop(L, 2);
    lua_insert(L, 1);  // as TakeSelf does
    return name ? CallVariable(L, record, *name, false) : Operate(L, *record, &LuaType::lw_index);
}

int luatype_call_newindex(lua_State* L) {
    LuaObjectRec* record = TakeSelf(L, 2);
    if (!record) return 0;
    if (lua_type(L, 1) == LUA_TSTRING) {
        Name name = FindName(L, 1, record->m_Type, true);
        if (name.m_Owner) {
            lua_remove(L, 1);
            return CallVariable(L, record, name, true);
        }
    }
    return Operate(L, *record, &LuaType::lw_newindex);
}

constexpr luaL_Reg kMetamethods[] = {
    {"_typename", luatype_call_typename},
    {"_istypeof", luatype_call_istypeof},
    {"__tostring", luatype_call_tostring},
    {"__call", luatype_call_call},
    {"__gc", luatype_call_gc},
    {"__index", luatype_call_index},
    {"__newindex", luatype_call_newindex},
    {"__add", luatype_call_add},
    {"__sub", luatype_call_sub},
    {"__mul", luatype_call_mul},
    {"__div", luatype_call_div},
    {"__pow", luatype_call_pow},
    {"__unm", luatype_call_unm},
    {"__eq", luatype_call_eq},
    {"__lt", luatype_call_lt},
    {"__le", luatype_call_le},
    {"__concat", luatype_call_concat},
};

// Makes a type's metatable, enters it in the registry and leaves it on the stack.
void MakeMetatable(lua_State* L, LuaType* type) {
    lua_createtable(L, 0, static_cast<int>(std::size(kMetamethods)));
    lua_newtable(L);
    for (const luaL_Reg& field : kMetamethods) {
        lua_pushstring(L, field.name);
        lua_pushvalue(L, -3);
        lua_pushvalue(L, -3);
        lua_pushcclosure(L, field.func, 2);
        lua_rawset(L, -4);
    }
    lua_pop(L, 1);
    lua_pushvalue(L, -1);
    lua_pushlightuserdata(L, type);
    lua_rawset(L, LUA_REGISTRYINDEX);
    lua_pushlightuserdata(L, type);
    lua_pushvalue(L, -2);
    lua_rawset(L, LUA_REGISTRYINDEX);
    lua_pushstring(L, type->GetName());
    lua_pushvalue(L, -2);
    lua_rawset(L, LUA_REGISTRYINDEX);
}

// An object must not be without its metatable, or its reference would never be given back: a type
// that is not registered gets it here.
void PushMetatable(lua_State* L, LuaType* type) {
    lua_pushlightuserdata(L, type);
    lua_rawget(L, LUA_REGISTRYINDEX);
    if (lua_istable(L, -1)) return;
    lua_pop(L, 1);
    MakeMetatable(L, type);
}

// Caches are weak tables that hold the userdata of native pointers, and the type names of their
// metatables.

// Pushes what the cache at `cache` has for a native pointer, and returns the userdata's contents.
void** PushCached(lua_State* L, int cache, void* object) {
    lua_pushlightuserdata(L, object);
    lua_rawget(L, cache);
    return static_cast<void**>(lua_touserdata(L, -1));
}

// Gives the userdata at `userdata` the metatable on top of the stack, which is popped.
void SetNamedMetatable(lua_State* L, int cache, int userdata, const char* name) {
    lua_pushvalue(L, -1);
    lua_pushstring(L, name);
    lua_rawset(L, cache);
    lua_setmetatable(L, userdata);
}

// Enters the userdata on top of the stack in the cache below it, which leaves the stack.
void FinishCached(lua_State* L, int cache, void* object) {
    lua_pushlightuserdata(L, object);
    lua_pushvalue(L, -2);
    lua_rawset(L, cache);
    lua_replace(L, cache);
}

}  // namespace

uint32_t gethash(const char* text) {
    uint32_t hash = 0;
    if (!text) return hash;
    for (bool odd = false; *text; text++, odd = !odd) {
        auto c = static_cast<uint32_t>(static_cast<signed char>(*text));
        hash ^= odd ? c ^ (hash << 7) ^ (hash >> 3) : ~(c ^ (hash << 11)) ^ (hash >> 5);
    }
    return hash;
}

_LuaType::_LuaType(const char* name, LuaType* parent, LuaFuncTable* functions,
                   LuaMemberTable* members, uint32_t data1, uint32_t data2)
    : m_Next(g_LuaTypeList),
      m_Parent(parent),
      m_Name(name ? name : ""),
      m_Data1(data1),
      m_Data2(data2),
      m_Functions(functions ? functions : s_NoFunctions),
      m_Members(members ? members : s_NoMembers),
      m_Values(new ScriptVal(SV_Table, nullptr)) {
    g_LuaTypeList = this;
    FillHashes(m_Members);
    FillHashes(m_Functions);
}

_LuaType::~_LuaType() {
    _LuaType** link = &g_LuaTypeList;
    while (*link != this) link = &(*link)->m_Next;
    *link = m_Next;
    delete m_Values;
}

LuaType* _LuaType::FindType(const char* name) {
    auto type = name ? static_cast<LuaType*>(this) : nullptr;
    while (type && strcmp(type->GetName(), name) != 0) type = type->GetParent();
    return type;
}

void _LuaType::lw_register(lua_State* L) {
    luaL_checkstack(L, LUA_MINSTACK, "registering a type");
    lua_pushliteral(L, "class");
    lua_rawget(L, LUA_GLOBALSINDEX);
    if (!lua_istable(L, -1)) {
        lua_pop(L, 1);
        lua_newtable(L);
        lua_pushliteral(L, "class");
        lua_pushvalue(L, -2);
        lua_rawset(L, LUA_GLOBALSINDEX);
    }
    lw_register(L, -1);
    lua_pop(L, 1);
}

void _LuaType::lw_register(lua_State* L, int index) {
    luaL_checkstack(L, LUA_MINSTACK, "registering a type");
    index = lua_absindex(L, index);
    auto type = static_cast<LuaType*>(this);
    lua_pushstring(L, m_Name);
    lua_pushlightuserdata(L, type);
    lua_pushcclosure(L, luatype_call_create, 1);
    lua_rawset(L, index);
    MakeMetatable(L, type);
    lua_pop(L, 1);
}

int _LuaType::lw_push(lua_State* L, void* object, unsigned int flags) {
    auto type = static_cast<LuaType*>(this);
    lua_pushLuaObject(L, object ? type->lw_from_type(object) : nullptr, type, flags);
    return 1;
}

void lua_pushLuaObject(lua_State* L, void* object, LuaType* type, unsigned int flags) {
    luaL_checkstack(L, LUA_MINSTACK, "pushing an object");
    if (!object || !type) return lua_pushnil(L);
    PushWeakTable(L, reinterpret_cast<void*>(&lua_pushLuaObject));
    int cache = lua_gettop(L);
    if (void** userdata = PushCached(L, cache, object)) {
        // A released userdata is no use, and one of an unrelated type belongs to another object:
        // the first member of a class has the address of the whole.
        auto record = static_cast<LuaObjectRec*>(*userdata);
        if (record && (IsOneOf(record->m_Type, type) || IsOneOf(type, record->m_Type))) {
            return lua_replace(L, cache);
        }
    }
    lua_settop(L, cache);

    // Whatever raises an error on the way leaves a userdata that gives back just what it took.
    auto record = static_cast<LuaObjectRec**>(lua_newuserdata(L, sizeof(LuaObjectRec*)));
    *record = nullptr;
    PushMetatable(L, type);
    SetNamedMetatable(L, cache, cache + 1, type->GetName());
    *record = new LuaObjectRec(type, object, flags | LWF_NoReference);
    if (!*record) luaL_error(L, "not enough memory");
    if (!(flags & LWF_NoReference)) {
        Operate(L, **record, &LuaType::lw_use);
        lua_settop(L, cache + 1);
        (*record)->m_Flags = flags;
    }
    FinishCached(L, cache, object);
}

void lua_pushobject(lua_State* L, void* object, const char* typeName) {
    luaL_checkstack(L, LUA_MINSTACK, "pushing an object");
    if (!object) return lua_pushnil(L);
    PushWeakTable(L, reinterpret_cast<void*>(&lua_pushobject));
    int cache = lua_gettop(L);
    void** userdata = PushCached(L, cache, object);
    // Whoever releases the pointer of a userdata clears it, and the address may come again.
    if (userdata && *userdata == object) return lua_replace(L, cache);
    lua_settop(L, cache);

    *static_cast<void**>(lua_newuserdata(L, sizeof(void*))) = object;
    if (typeName) {
        lua_getfield(L, LUA_REGISTRYINDEX, typeName);
        if (lua_istable(L, -1)) {
            lua_pushvalue(L, -1);
            if (PopTypesMetatable(L)) {
                luaL_error(L, "lua_pushobject: \"%s\" is a type; use lua_pushLuaObject", typeName);
            }
            SetNamedMetatable(L, cache, cache + 1, typeName);
        } else {
            lua_pop(L, 1);
        }
    }
    FinishCached(L, cache, object);
}

void safe_istype(lua_State* L, IsTypeData* data) {
    data->m_Result = ToRecordOf(L, data->m_Index, data->m_Name) != nullptr;
}

bool lua_istype(lua_State* L, int index, const char* name) {
    IsTypeData data{false, index, name};
    safe_istype(L, &data);
    return data.m_Result;
}

void* lua_totype(lua_State* L, int index, const char* name) {
    LuaObjectRec* record = ToRecordOf(L, index, name);
    if (!record) return nullptr;
    LuaType* named = record->m_Type->FindType(name);
    return (named ? named : record->m_Type)->lw_to_type(record->m_Object);
}

void lw_flaunttable(lua_State* L, const char* table, const char* field) {
    luaL_checkstack(L, LUA_MINSTACK, "copying a table");
    int top = lua_gettop(L);
    lua_pushstring(L, table);
    lua_rawget(L, LUA_GLOBALSINDEX);
    if (lua_istable(L, -1) && field) {
        lua_pushstring(L, field);
        lua_pushvalue(L, -1);
        lua_rawget(L, top + 1);
        if (!lua_isnil(L, -1)) lua_rawset(L, LUA_GLOBALSINDEX);
    } else if (lua_istable(L, -1)) {
        lua_pushnil(L);
        while (lua_next(L, top + 1)) {
            lua_pushvalue(L, -2);
            lua_insert(L, -2);
            lua_rawset(L, LUA_GLOBALSINDEX);
        }
    }
    lua_settop(L, top);
}

int lua_absindex(lua_State* L, int index) {
    return index < 0 && index > LUA_REGISTRYINDEX ? lua_gettop(L) + 1 + index : index;
}

double lua_tonumber_def(lua_State* L, int index, double fallback) {
    return lua_type(L, index) == LUA_TNUMBER ? lua_tonumber(L, index) : fallback;
}

const char* lua_tostring_def(lua_State* L, int index, const char* fallback) {
    return lua_type(L, index) == LUA_TSTRING ? lua_tostring(L, index) : fallback;
}

bool lua_toboolean_def(lua_State* L, int index, bool fallback) {
    return lua_isboolean(L, index) ? lua_toboolean(L, index) : fallback;
}

bool lua_istrue(lua_State* L, int index) {
    return lua_toboolean(L, index);
}

}  // namespace Korvel

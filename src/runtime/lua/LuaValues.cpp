#include "runtime/lua/LuaValues.h"

#include <climits>
#include <cmath>
#include <cstring>
#include <lua.hpp>
#include <string_view>
#include <utility>

#include "core/NumbersInternal.h"
#include "core/ScriptValInternal.h"
#include "diag/Debug.h"
#include "objects/ScriptConfig.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"
#include "runtime/lua/KRScriptLibInternal.h"
#include "runtime/lua/LuaCodeInternal.h"
#include "runtime/lua/LuaGuardInternal.h"
#include "runtime/lua/LuaMemBlockInternal.h"
#include "runtime/lua/LuaObject.h"
#include "runtime/lua/LuaObjectInternal.h"
#include "runtime/lua/LuaType.h"

// Nearly every call of Lua here can raise an error, and where errors are long jumps no destructor
// runs. So nothing in this source owns anything while it calls Lua.
namespace Korvel {
namespace {

constexpr int kMaxResults = 255;

// Stack slots that one level of tables needs.
constexpr int kSlotsPerLevel = 10;

// The attributes of a table that Lua sees as fields, and which flags are worth one. Read-only is
// never passed on.
constexpr const char* kConstructorField = "__ctor";
constexpr const char* kFlagsField = "__flags";
constexpr uint32_t kTellingFlags = ~(SVF_TypeMask | SVF_ReadOnly | SVF_ExplicitKeys);
constexpr uint32_t kPassedFlags = ~(SVF_TypeMask | SVF_ReadOnly);

// What the functions of ordered tables keep in raw fields of theirs.
constexpr const char* kOrderFields[] = {"__idxtokey", "__keytoidx"};

[[noreturn]] void RaiseError(lua_State* L, const char* text) {
    luaL_error(L, "%s", text);
    __builtin_unreachable();
}

[[noreturn]] void RaiseUnsupported(lua_State* L) {
    RaiseError(L, "Unsupported type for custom data!");
}

// What a conversion may still take. A table that stands in many places counts in each of them, so
// a small one could become more than there is memory for.
class Budget {
public:
    // Before a table is entered that has `depth` tables around it.
    void EnterTable(lua_State* L, int depth) {
        if (depth >= kMaxNesting) Raise(L);
        if (depth == 0) m_Bytes = GetMaxPacketSize();
        luaL_checkstack(L, kSlotsPerLevel, "no room for a table");
    }
    void Take(lua_State* L, const ScriptVal& value) { Take(L, SizeOf(value)); }

    // For a constructor or flags of a table.
    void TakeAttribute(lua_State* L, size_t length = 0) {
        Take(L, 2 * kSmall + static_cast<int64_t>(length));
    }

private:
    static constexpr int64_t kSmall = 12;

    [[noreturn]] static void Raise(lua_State* L) { RaiseError(L, "Table nested too deeply."); }
    static int64_t SizeOf(const ScriptVal& value);
    void Take(lua_State* L, int64_t bytes) {
        m_Bytes -= bytes;
        if (m_Bytes < 0) Raise(L);
    }

    int64_t m_Bytes = 0;
};

// About as many bytes as in a packet; what is inside of a table counts by itself.
int64_t Budget::SizeOf(const ScriptVal& value) {
    constexpr int64_t kObject = 44;
    switch (value.Type()) {
        case SV_String:
            return kSmall + static_cast<int64_t>(strlen(value.ToString()));
        case SV_MemBlock:
            return kSmall + int64_t{value.ToMemBlock().m_Size};
        case SV_Code:
            return kSmall + int64_t{value.ToCodeLen()};
        case SV_RemoteObject:
        case SV_LocalObject:
            return kObject;
        default:
            return kSmall;
    }
}

// One conversion to Lua.
class Writer {
public:
    Writer(RemoteApp* app, lua_State* L, ToLuaFunc callback, void* user, unsigned int flags,
           TagList* tags)
        : m_App(app), m_Lua(L), m_Callback(callback), m_User(user), m_Flags(flags), m_Tags(tags) {
        if (m_Config && !m_Config->ToLua) m_Config = nullptr;
    }

    // Pushes a value that has `depth` tables around it, or as many results as that of code. There
    // must be a few free slots.
    bool Write(ScriptVal& value, int depth, int numResults = 1);

private:
    struct Target {
        int m_Table;
        bool m_IsOrdered;
    };

    bool HasHost() const { return m_Callback || m_Config; }
    bool WriteByHost(ScriptVal& value);
    void WriteLocalObject(const ScriptVal& value);
    void WriteCode(const ScriptVal& code, int numResults);
    void WriteTable(ScriptVal& value, int depth);
    void WriteAttributes(const Target& target, const ScriptVal& table);
    void WriteEntry(const Target& target, TableEntry& entry, int depth);
    bool PushOrderedTable();
    void PushPlainTable(const ScriptVal& value);
    bool CanStore(const Target& target);
    void Store(const Target& target);

    RemoteApp* const m_App;
    lua_State* const m_Lua;
    const ToLuaFunc m_Callback;
    void* const m_User;
    const unsigned int m_Flags;
    TagList* const m_Tags;
    // Null when it has no part in this.
    const ScriptConfig* m_Config = g_ScriptConfig.load(std::memory_order_acquire);
    Budget m_Budget;
    bool m_HasRefused = false;  // code, which is told once
};

// Whatever the host leaves on the stack, one value comes of it or none.
[[gnu::noinline]] bool Writer::WriteByHost(ScriptVal& value) {
    luaL_checkstack(m_Lua, LUA_MINSTACK, "no room for a callback");
    int top = lua_gettop(m_Lua);
    int isDone = CallOut(m_Lua, [&] {
        return (m_Callback && m_Callback(m_App, m_Lua, value, m_User)) ||
               (m_Config && m_Config->ToLua(m_App, m_Lua, value, m_Config->m_UserData, m_Tags));
    });
    if (isDone && lua_gettop(m_Lua) > top + 1) lua_replace(m_Lua, top + 1);
    lua_settop(m_Lua, top + isDone);
    return isDone;
}

bool Writer::Write(ScriptVal& value, int depth, int numResults) {
    if (HasHost() && WriteByHost(value)) return true;
    switch (value.Type()) {
        case SV_Nil:
            lua_pushnil(m_Lua);
            return true;
        case SV_Number:
            lua_pushnumber(m_Lua, value.m_Value.m_Number);
            return true;
        case SV_String:
            lua_pushstring(m_Lua, value.ToString());
            return true;
        case SV_Boolean:
            lua_pushboolean(m_Lua, value.m_Value.m_Boolean);
            return true;
        case SV_MemBlock:
            return PushMemBlock(m_Lua, value.ToMemBlock());
        case SV_Table:
        case SV_Args:
            WriteTable(value, depth);
            return true;
        case SV_RemoteObject:
            lua_pushLuaObject(m_Lua, value.ToRemoteObject(), &s_LuaType_RemoteObject);
            return true;
        case SV_LocalObject:
            WriteLocalObject(value);
            return true;
        case SV_Function:
            PushFunction(m_Lua, value.ToFunction(), value.m_Flags & ~SVF_TypeMask);
            return true;
        case SV_Code:
            WriteCode(value, numResults);
            return true;
        default:
            return false;
    }
}

void Writer::WriteLocalObject(const ScriptVal& value) {
    // TODO(ffi): an object that is a foreign pointer becomes one again, once there are bindings.
    ScriptObject* object = value.m_Flags & SVF_Foreign ? nullptr : value.ToLocalObject();
    if (!m_App || !object) return lua_pushnil(m_Lua);
    if (m_Flags & TOLUA_AskPeer) {
        auto address = reinterpret_cast<uintptr_t>(object);
        return _PushScriptObject(m_Lua, m_App->LocalToRemote(address), false);
    }
    if (!m_App->Connected()) return lua_pushnil(m_Lua);
    PushLocalObject(m_Lua, m_App, value);
}

void Writer::WriteCode(const ScriptVal& code, int numResults) {
    if (MayRunCode(code)) return PushCodeResults(m_Lua, code, numResults);
    if (!std::exchange(m_HasRefused, true)) {
        g_ScriptServerLog.PrintF("Code that came from another process was not run.\n");
    }
    lua_pushnil(m_Lua);
}

// A new ordered table; false, with nothing pushed, where scripts have none to offer.
bool Writer::PushOrderedTable() {
    int top = lua_gettop(m_Lua);
    PushGlobalRaw(m_Lua, "table");
    if (lua_istable(m_Lua, -1)) {
        lua_pushliteral(m_Lua, "ordered");
        lua_rawget(m_Lua, top + 1);
        lua_replace(m_Lua, top + 1);
        if (lua_pcall(m_Lua, 0, 1, 0) == 0 && lua_istable(m_Lua, -1)) return true;
    }
    lua_settop(m_Lua, top);
    return false;
}

void Writer::PushPlainTable(const ScriptVal& value) {
    constexpr int kMostCounted = 1 << 20;
    int items = 0;
    int fields = 0;
    TableEntry* entry = Chain::Head(value);
    for (; entry && items + fields < kMostCounted; entry = entry->m_Next) {
        (Chain::NumberOf(entry) == items + 1 ? items : fields)++;
    }
    lua_createtable(m_Lua, items, fields);
}

// Whether the value on top of the stack can be a key. Lua has no entries under nil, nor under NaN,
// which alone is not equal to itself. The order of an ordered table is its own.
bool Writer::CanStore(const Target& target) {
    if (lua_isnil(m_Lua, -1) || !lua_rawequal(m_Lua, -1, -1)) return false;
    if (!target.m_IsOrdered || lua_type(m_Lua, -1) != LUA_TSTRING) return true;
    const char* key = lua_tostring(m_Lua, -1);
    return strcmp(key, kOrderFields[0]) != 0 && strcmp(key, kOrderFields[1]) != 0;
}

// Pops a value and a key. An ordered table notes its keys in its metamethods.
void Writer::Store(const Target& target) {
    if (target.m_IsOrdered) {
        lua_settable(m_Lua, target.m_Table);
    } else {
        lua_rawset(m_Lua, target.m_Table);
    }
}

void Writer::WriteAttributes(const Target& target, const ScriptVal& table) {
    if (const char* constructor = table.GetConstructor()) {
        m_Budget.TakeAttribute(m_Lua, strlen(constructor));
        lua_pushstring(m_Lua, kConstructorField);
        lua_pushstring(m_Lua, constructor);
        Store(target);
    }
    if (table.m_Flags & kTellingFlags) {
        m_Budget.TakeAttribute(m_Lua);
        lua_pushstring(m_Lua, kFlagsField);
        lua_pushnumber(m_Lua, table.m_Flags & kPassedFlags);
        Store(target);
    }
}

void Writer::WriteTable(ScriptVal& value, int depth) {
    m_Budget.EnterTable(m_Lua, depth);
    bool isTable = value.IsTable();
    Target target{lua_gettop(m_Lua) + 1,
                  isTable && (value.m_Flags & SVF_Ordered) && PushOrderedTable()};
    if (!target.m_IsOrdered) PushPlainTable(value);
    if (isTable) WriteAttributes(target, value);
    for (TableEntry* entry = Chain::Head(value); entry; entry = entry->m_Next) {
        WriteEntry(target, *entry, depth + 1);
    }
}

void Writer::WriteEntry(const Target& target, TableEntry& entry, int depth) {
    m_Budget.Take(m_Lua, entry.m_Key);
    m_Budget.Take(m_Lua, entry.m_Value);
    double number = Chain::NumberOf(&entry);
    if (number >= 1 && number <= INT_MAX && number == static_cast<int>(number) &&
        !target.m_IsOrdered && !HasHost()) {
        if (Write(entry.m_Value, depth)) {
            lua_rawseti(m_Lua, target.m_Table, static_cast<int>(number));
        }
        return;
    }
    if (!Write(entry.m_Key, depth)) return;
    if (CanStore(target) && Write(entry.m_Value, depth)) {
        Store(target);
    } else {
        lua_pop(m_Lua, 1);
    }
}

// A text as a string value can hold it. A NUL would end it, the marker of text cells become '?'.
bool IsPlainText(const char* text, size_t length) {
    return !TextCell::IsCell(text) && !memchr(text, '\0', length);
}

// A table that is being read, and what is to be done about it in the end.
struct Filling {
    explicit Filling(ScriptVal& table) : m_Table(table) {}

    void Note(const ScriptVal& key);
    void Finish();

    ScriptVal& m_Table;
    uint32_t m_Flags = 0;
    double m_Greatest = -HUGE_VAL;  // of the number keys so far
    bool m_HasOtherKeys = false;
    bool m_IsArranged = true;  // ascending numbers, then other keys
};

void Filling::Note(const ScriptVal& key) {
    if (!key.IsNumber()) {
        m_HasOtherKeys = true;
        return;
    }
    double number = key.m_Value.m_Number;
    if (m_HasOtherKeys || !(number > m_Greatest)) m_IsArranged = false;
    m_Greatest = number;
}

// Flags come last: a read-only table could not be filled.
void Filling::Finish() {
    if (!m_IsArranged) {
        TableEntry* numbers = nullptr;
        TableEntry* others = nullptr;
        TableEntry** numberLink = &numbers;
        TableEntry** otherLink = &others;
        for (TableEntry* entry = m_Table.TakeTable(); entry; entry = entry->m_Next) {
            TableEntry**& link = entry->m_Key.IsNumber() ? numberLink : otherLink;
            *link = entry;
            link = &entry->m_Next;
        }
        *otherLink = nullptr;
        *numberLink = others;
        m_Table.SetTable(numbers);
    }
    m_Table.m_Flags |= m_Flags;
}

// One conversion from Lua. Indices count from the bottom of the stack.
class Reader {
public:
    Reader(lua_State* L, FromLuaFunc callback, void* user, unsigned int flags)
        : m_Lua(L), m_Callback(callback), m_User(user), m_Flags(flags) {
        if (m_Config && !m_Config->FromLua) m_Config = nullptr;
        m_RunsOthers = HasHost();
    }

    // Reads a value that has `depth` tables around it.
    bool Read(int index, ScriptVal& value, int depth);

private:
    bool HasHost() const { return m_Callback || m_Config; }
    bool ReadByHost(int index, ScriptVal& value);
    bool ReadString(int index, ScriptVal& value);
    bool ReadBlock(const MemBlock& block, ScriptVal& value);
    bool ReadTable(int index, ScriptVal& value, int depth);
    bool ReadEntry(Filling& filling, int key, int depth);
    bool ReadConstructor(int index, ScriptVal& table);
    int PushOrderedNext(int index);
    bool Next(int table, int orderedNext);

    lua_State* const m_Lua;
    const FromLuaFunc m_Callback;
    void* const m_User;
    const unsigned int m_Flags;
    // Null when it has no part in this.
    const ScriptConfig* m_Config = g_ScriptConfig.load(std::memory_order_acquire);
    Budget m_Budget;
    bool m_RunsOthers;  // hosts and scripts, which may change the tables that are read
};

[[gnu::noinline]] bool Reader::ReadByHost(int index, ScriptVal& value) {
    luaL_checkstack(m_Lua, LUA_MINSTACK, "no room for a callback");
    int top = lua_gettop(m_Lua);
    bool isDone = CallOut(m_Lua, [&] {
        return (m_Callback && m_Callback(m_Lua, index, value, m_User)) ||
               (m_Config && m_Config->FromLua(m_Lua, index, value, m_Config->m_UserData, nullptr));
    });
    lua_settop(m_Lua, top);
    return isDone;
}

bool Reader::Read(int index, ScriptVal& value, int depth) {
    if (HasHost() && ReadByHost(index, value)) return true;
    if (value.IsReadOnly()) return true;  // as with all that sets a value
    switch (lua_type(m_Lua, index)) {
        case LUA_TNIL:
            value = SV_Nil;
            return true;
        case LUA_TNUMBER:
            value = lua_tonumber(m_Lua, index);
            return true;
        case LUA_TBOOLEAN:
            value = lua_toboolean(m_Lua, index) != 0;
            return true;
        case LUA_TSTRING:
            return ReadString(index, value);
        case LUA_TTABLE:
            return ReadTable(index, value, depth);
        case LUA_TFUNCTION:
            return ReadCode(m_Lua, index, value);
        case LUA_TUSERDATA:
            if (const MemBlock* block = ToMemBlock(m_Lua, index)) return ReadBlock(*block, value);
            if (RemoteObject* object = ToScriptObject(m_Lua, index)) {
                ReadObject(object, value);
                return true;
            }
            break;
        default:
            break;
    }
    RaiseUnsupported(m_Lua);
}

bool Reader::ReadBlock(const MemBlock& block, ScriptVal& value) {
    value = block;
    return value.IsMemBlock();
}

bool Reader::ReadString(int index, ScriptVal& value) {
    size_t length;
    const char* text = lua_tolstring(m_Lua, index, &length);
    if (length > INT_MAX) RaiseUnsupported(m_Lua);
    if (!IsPlainText(text, length)) {
        return ReadBlock({const_cast<char*>(text), static_cast<uint32_t>(length)}, value);
    }
    value.Set(SV_String, &text, static_cast<int>(length));
    return value.IsString();
}

// Pushes the iterator of an ordered table and returns its index; 0 for any other table.
int Reader::PushOrderedNext(int index) {
    if (!lua_getmetatable(m_Lua, index)) return 0;
    PushGlobalRaw(m_Lua, "_orderedtable_meta");
    bool isOrdered = lua_rawequal(m_Lua, -1, -2);
    lua_pop(m_Lua, 2);
    if (!isOrdered) return 0;
    m_RunsOthers = true;
    PushGlobalRaw(m_Lua, "_orderedtable_next");
    return lua_gettop(m_Lua);
}

// Lua's `next`, which raises where the key has left the table.
int PlainNext(lua_State* L) {
    lua_settop(L, 2);
    if (!lua_next(L, 1)) lua_pushnil(L);
    return lua_gettop(L) - 1;
}

// Replaces the key on top of the stack by the next key and its value; at the end, which an error of
// the step is too, false.
bool Reader::Next(int table, int orderedNext) {
    if (!orderedNext && !m_RunsOthers) return lua_next(m_Lua, table);
    int key = lua_gettop(m_Lua);
    if (orderedNext) {
        lua_pushvalue(m_Lua, orderedNext);
    } else {
        lua_pushcfunction(m_Lua, PlainNext);
    }
    lua_pushvalue(m_Lua, table);
    lua_pushvalue(m_Lua, key);
    if (lua_pcall(m_Lua, 2, 2, 0) != 0 || lua_isnil(m_Lua, -2)) return false;
    lua_remove(m_Lua, key);
    return true;
}

bool Reader::ReadTable(int index, ScriptVal& value, int depth) {
    m_Budget.EnterTable(m_Lua, depth);
    value = SV_Table;
    Filling filling(value);
    bool isConsumed = m_Flags & FROMLUA_Consume;
    bool isRead = true;
    int top = lua_gettop(m_Lua);
    int orderedNext = PushOrderedNext(index);
    if (orderedNext) filling.m_Flags = SVF_Ordered;
    lua_pushnil(m_Lua);
    while (isRead && Next(index, orderedNext)) {
        int key = lua_gettop(m_Lua) - 1;
        isRead = ReadEntry(filling, key, depth + 1);
        lua_settop(m_Lua, key);
        if (!isConsumed || !isRead) continue;
        // The walk goes on from the key that loses its value here, which Lua allows.
        lua_pushvalue(m_Lua, key);
        lua_pushnil(m_Lua);
        lua_rawset(m_Lua, index);
    }
    lua_settop(m_Lua, top);
    filling.Finish();
    if (isConsumed && depth == 0) lua_gc(m_Lua, LUA_GCCOLLECT, 0);
    return isRead;
}

// Reads the key at `key` and the value behind it. The entry is the table's before anything else can
// fail, and so the caller's.
bool Reader::ReadEntry(Filling& filling, int key, int depth) {
    int value = key + 1;
    if (lua_type(m_Lua, key) == LUA_TSTRING) {
        size_t length;
        const char* text = lua_tolstring(m_Lua, key, &length);
        std::string_view name(text, length);
        if (name == kConstructorField) return ReadConstructor(value, filling.m_Table);
        if (name == kFlagsField) {
            m_Budget.TakeAttribute(m_Lua);
            if (lua_type(m_Lua, value) == LUA_TNUMBER) {
                filling.m_Flags = Low32(lua_tonumber(m_Lua, value)) & ~SVF_TypeMask;
            }
            return true;
        }
        if (TextCell::IsCell(text)) RaiseUnsupported(m_Lua);
    }
    TableEntry* entry = NewEntry();
    if (!entry) return false;
    Chain::Append(filling.m_Table, entry);
    if (!Read(key, entry->m_Key, depth)) return false;
    filling.Note(entry->m_Key);
    m_Budget.Take(m_Lua, entry->m_Key);
    if (!Read(value, entry->m_Value, depth)) return false;
    m_Budget.Take(m_Lua, entry->m_Value);
    return true;
}

// Anything but a text is passed over.
bool Reader::ReadConstructor(int index, ScriptVal& table) {
    bool isText = lua_type(m_Lua, index) == LUA_TSTRING;
    m_Budget.TakeAttribute(m_Lua, isText ? lua_objlen(m_Lua, index) : 0);
    if (!isText) return true;
    size_t length;
    const char* text = lua_tolstring(m_Lua, index, &length);
    if (!IsPlainText(text, length)) RaiseUnsupported(m_Lua);
    table.SetConstructor(text);
    return table.GetConstructor();
}

}  // namespace

bool ToLua(RemoteApp* app, lua_State* L, ScriptVal& value, ToLuaFunc callback, void* user,
           unsigned int flags, TagList* tags) {
    luaL_checkstack(L, kSlotsPerLevel, "no room for a value");
    return Writer(app, L, callback, user, flags, tags).Write(value, 0, LUA_MULTRET);
}

int ToLuaRet(RemoteApp* app, lua_State* L, ScriptVal& value, ToLuaFunc callback, void* user,
             unsigned int flags) {
    if (!Chain::IsList(value)) return 0;
    ScriptVal* results[kMaxResults];
    int count = 0;
    for (TableEntry* entry = Chain::Head(value); entry; entry = entry->m_Next) {
        double position = -Chain::NumberOf(entry);
        if (!(position >= 1 && position <= kMaxResults)) continue;
        int number = static_cast<int>(position);
        while (count < number) results[count++] = nullptr;
        if (number == position) results[number - 1] = &entry->m_Value;
    }
    luaL_checkstack(L, count + kSlotsPerLevel, "no room for the results");
    Writer writer(app, L, callback, user, flags, nullptr);
    for (int i = 0; i < count; i++) {
        if (!results[i] || !writer.Write(*results[i], 0)) lua_pushnil(L);
    }
    return count;
}

bool FromLua(lua_State* L, int index, ScriptVal& value, FromLuaFunc callback, void* user,
             unsigned int flags) {
    luaL_checkstack(L, kSlotsPerLevel, "no room for a value");
    return Reader(L, callback, user, flags).Read(lua_absindex(L, index), value, 0);
}

bool lua_toscriptval(lua_State* L, int index, ScriptVal& value) {
    return FromLua(L, index, value, nullptr, nullptr, 0);
}

bool lua_pushscriptval(lua_State* L, ScriptVal& value) {
    return ToLua(nullptr, L, value, nullptr, nullptr, 0);
}

}  // namespace Korvel

// Values on their way from Lua through a packet and back: what a script can build is refused, or
// comes back as the same; what a peer can send is something that Lua can hold. Nothing is left on
// the stack.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <lua.hpp>
#include <vector>

#include "core/ScriptVal.h"
#include "runtime/lua/KRScriptLibInternal.h"
#include "runtime/lua/LuaValues.h"

using namespace Korvel;

namespace {

void Check(bool holds) {
    if (!holds) abort();
}

// Builds a Lua value from bytes, without an error for any of them but where memory runs out.
class Builder {
public:
    Builder(lua_State* L, const uint8_t* data, size_t size)
        : m_Lua(L), m_At(data), m_End(data + size) {}

    void Push(int depth);

private:
    uint8_t Take() { return m_At < m_End ? *m_At++ : 0; }
    void PushNumber();
    void PushString();
    void PushFields(int depth);
    void PushNest(int depth);
    void Call(const char* table, const char* function);

    lua_State* const m_Lua;
    const uint8_t* m_At;
    const uint8_t* const m_End;
};

void Builder::PushNumber() {
    uint8_t bytes[8];
    for (uint8_t& byte : bytes) byte = Take();
    double number;
    memcpy(&number, bytes, sizeof(number));
    lua_pushnumber(m_Lua, number == number ? number : 0);  // other NaNs are pointers to LuaJIT
}

void Builder::PushString() {
    size_t length = Take() % 32;
    if (length > static_cast<size_t>(m_End - m_At)) length = static_cast<size_t>(m_End - m_At);
    lua_pushlstring(m_Lua, reinterpret_cast<const char*>(m_At), length);
    m_At += length;
}

// Adds up to seven entries to the table on top of the stack.
void Builder::PushFields(int depth) {
    constexpr const char* kAttributes[] = {"__ctor", "__flags"};
    for (int count = Take() % 8; count > 0; count--) {
        uint8_t kind = Take();
        if (kind < 240) {
            Push(depth + 1);
        } else {
            lua_pushstring(m_Lua, kAttributes[kind & 1]);
        }
        Push(depth + 1);
        bool isKey = !lua_isnil(m_Lua, -2) && lua_rawequal(m_Lua, -2, -2);
        if (isKey) {
            lua_settable(m_Lua, -3);
        } else {
            lua_pop(m_Lua, 2);
        }
    }
}

// A value with many tables around it.
void Builder::PushNest(int depth) {
    int count = Take() * 2;
    Push(depth + 1);
    for (; count > 0; count--) {
        lua_createtable(m_Lua, 1, 0);
        lua_insert(m_Lua, -2);
        lua_rawseti(m_Lua, -2, 1);
    }
}

void Builder::Call(const char* table, const char* function) {
    lua_getglobal(m_Lua, table);
    lua_getfield(m_Lua, -1, function);
    lua_remove(m_Lua, -2);
    lua_call(m_Lua, 0, 1);
}

void Builder::Push(int depth) {
    constexpr int kMaxDepth = 40;
    luaL_checkstack(m_Lua, 8, "deep input");
    switch (depth < kMaxDepth ? Take() % 12 : 0) {
        case 1:
            return lua_pushboolean(m_Lua, Take() & 1);
        case 2:
            return lua_pushnumber(m_Lua, static_cast<int8_t>(Take()));
        case 3:
            return PushNumber();
        case 4:
        case 5:
            return PushString();
        case 6:
            lua_newtable(m_Lua);
            return PushFields(depth);
        case 7:
            Call("table", "ordered");
            return PushFields(depth);
        case 8:
            return PushNest(depth);
        case 9:  // the same table once more, which may be one that is being filled
            return lua_pushvalue(m_Lua, 1 + Take() % lua_gettop(m_Lua));
        case 10:
            return lua_getglobal(m_Lua, "print");
        case 11:
            lua_getglobal(m_Lua, Take() & 1 ? "code" : "coroutine");
            return;
        default:
            return lua_pushnil(m_Lua);
    }
}

std::vector<unsigned char> Write(const ScriptVal& value) {
    std::vector<unsigned char> bytes(value.CalcPktSize());
    unsigned char* cursor = bytes.data();
    Check(!bytes.empty() && value.ToPkt(nullptr, cursor));
    Check(cursor == bytes.data() + bytes.size());
    return bytes;
}

ScriptVal Read(std::vector<unsigned char> bytes) {
    ScriptVal value;
    unsigned char* cursor = bytes.data();
    value.FromPkt(nullptr, cursor, bytes.data() + bytes.size());
    return value;
}

// One conversion in a protected call. False where it has raised an error.
struct Conversion {
    bool Run(lua_State* L, lua_CFunction function) {
        lua_pushcfunction(L, function);
        lua_insert(L, 1);
        lua_pushlightuserdata(L, this);
        lua_insert(L, 2);
        return lua_pcall(L, lua_gettop(L) - 1, LUA_MULTRET, 0) == 0;
    }

    // Takes the value at the bottom of the stack, which becomes empty.
    bool FromLua(lua_State* L, unsigned int flags) {
        m_Flags = flags;
        bool isDone = Run(L, [](lua_State* inner) {
            auto& self = *static_cast<Conversion*>(lua_touserdata(inner, 1));
            int top = lua_gettop(inner);
            Check(Korvel::FromLua(inner, 2, self.m_Value, nullptr, nullptr, self.m_Flags));
            Check(lua_gettop(inner) == top);
            return 0;
        });
        lua_settop(L, 0);
        return isDone;
    }

    // Leaves the value on the stack, which was empty. Only one that takes too many bytes, which
    // those that came from a table of Lua may do, is refused.
    bool ToLua(lua_State* L) {
        bool isDone = Run(L, [](lua_State* inner) {
            auto& self = *static_cast<Conversion*>(lua_touserdata(inner, 1));
            int top = lua_gettop(inner);
            bool isPushed =
                Korvel::ToLua(nullptr, inner, self.m_Value, nullptr, nullptr, 0, nullptr);
            Check(lua_gettop(inner) == top + isPushed);
            return static_cast<int>(isPushed);
        });
        Check(isDone || strcmp(lua_tostring(L, -1), "Table nested too deeply.") == 0);
        if (!isDone) lua_settop(L, 0);
        return isDone;
    }

    ScriptVal m_Value;
    unsigned int m_Flags = 0;
};

// Whether Lua does not give back just this. Tables as keys, of which several may be equal, have no
// order that comes back, and the names of an ordered table's own fields are not for entries.
bool LosesEntries(const ScriptVal& value) {
    for (TableEntry* entry = nullptr; value.NextKey(entry);) {
        const ScriptVal& key = entry->m_Key;
        if (key.IsTable() || LosesEntries(entry->m_Value)) return true;
        if ((value.m_Flags & SVF_Ordered) && (key == "__idxtokey" || key == "__keytoidx")) {
            return true;
        }
    }
    return false;
}

// What is on the stack goes through a packet and comes back as the same. What does not even equal
// its own copy, as code, only has to arrive.
void GoThereAndBack(lua_State* L, unsigned int flags) {
    Conversion first;
    if (!first.FromLua(L, flags)) return;
    Conversion second;
    second.m_Value = Read(Write(first.m_Value));
    bool isComparable = first.m_Value == ScriptVal(first.m_Value) && !LosesEntries(first.m_Value);
    if (isComparable) Check(second.m_Value == first.m_Value);
    if (!second.ToLua(L)) return;
    Conversion third;
    if (lua_gettop(L) == 0) return;
    Check(third.FromLua(L, 0));
    if (isComparable) Check(third.m_Value == second.m_Value);
}

int Open(lua_State* L) {
    for (lua_CFunction library : {luaopen_base, luaopen_table}) {
        lua_pushcfunction(L, library);
        lua_call(L, 0, 0);
    }
    register_memblock(L);
    RunOrderedTableScript(L);
    Check(luaL_dostring(L, "code = function(a) return a and {a} or 5 end") == 0);
    return 0;
}

// An interpreter for one input, so that what it keeps is a leak.
class Interpreter {
public:
    Interpreter() { Check(lua_cpcall(m_Lua, Open, nullptr) == 0); }
    Interpreter(const Interpreter&) = delete;
    Interpreter& operator=(const Interpreter&) = delete;
    ~Interpreter() { lua_close(m_Lua); }

    lua_State* const m_Lua = luaL_newstate();
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    [[maybe_unused]] static int isSet = setenv("KORVEL_MaxPacketSize", "1", 1);
    if (size == 0) return 0;
    Interpreter interpreter;
    lua_State* L = interpreter.m_Lua;
    Builder builder(L, data + 1, size - 1);
    lua_pushlightuserdata(L, &builder);
    lua_pushcclosure(
        L,
        [](lua_State* inner) {
            lua_newtable(inner);
            static_cast<Builder*>(lua_touserdata(inner, lua_upvalueindex(1)))->Push(0);
            return 1;
        },
        1);
    if (lua_pcall(L, 0, 1, 0) == 0) {
        GoThereAndBack(L, data[0] & FROMLUA_Consume);
    }
    lua_settop(L, 0);

    Conversion received;
    received.m_Value = Read({data, data + size});
    if (received.ToLua(L) && lua_gettop(L) > 0) GoThereAndBack(L, 0);
    lua_settop(L, 0);
    return 0;
}

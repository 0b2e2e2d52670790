#include <cctype>
#include <cstdlib>
#include <cstring>
#include <lua.hpp>
#include <utility>

#include "core/0ReusePool.h"
#include "core/NumbersInternal.h"
#include "runtime/lua/LuaMemBlockInternal.h"
#include "runtime/lua/LuaType.h"
#include "runtime/lua/LuaValues.h"

namespace Korvel {
namespace {

constexpr const char* kTypeName = "MemBlock";

void FreeBlock(MemBlock* block) {
    if (!block) return;
    g_ReusePoolMgr.Free(block->m_Ptr);
    g_ReusePoolMgr.Free(block);
}

// Where a userdata of the type with this metatable has its pointer; null for any other value, which
// is not touched.
MemBlock** SlotOf(lua_State* L, int index, int metatable) {
    if (lua_type(L, index) != LUA_TUSERDATA || lua_objlen(L, index) != sizeof(MemBlock*) ||
        !lua_getmetatable(L, index)) {
        return nullptr;
    }
    bool isOurs = lua_rawequal(L, -1, metatable);
    lua_pop(L, 1);
    return isOurs ? static_cast<MemBlock**>(lua_touserdata(L, index)) : nullptr;
}

// The block that a metamethod works on; null when its first argument is none. The metatable is the
// upvalue of all of them.
MemBlock* Self(lua_State* L) {
    MemBlock** slot = SlotOf(L, 1, lua_upvalueindex(1));
    return slot ? *slot : nullptr;
}

// The byte that argument 2 stands for, counted from 1; null when there is none.
uint8_t* ByteOf(lua_State* L, const MemBlock* block) {
    if (!block || lua_type(L, 2) != LUA_TNUMBER) return nullptr;
    double position = lua_tonumber(L, 2);
    if (!(position >= 1 && position <= block->m_Size)) return nullptr;
    return static_cast<uint8_t*>(block->m_Ptr) + (static_cast<uint32_t>(position) - 1);
}

int Index(lua_State* L) {
    const MemBlock* block = Self(L);
    if (const uint8_t* byte = ByteOf(L, block)) {
        lua_pushinteger(L, *byte);
    } else if (block && lua_type(L, 2) == LUA_TSTRING && strcmp(lua_tostring(L, 2), "Size") == 0) {
        lua_pushnumber(L, block->m_Size);
    } else {
        lua_pushnil(L);
    }
    return 1;
}

// A number is cut to its low 8 bits.
int NewIndex(lua_State* L) {
    uint8_t* byte = ByteOf(L, Self(L));
    if (byte && lua_type(L, 3) == LUA_TNUMBER) {
        *byte = static_cast<uint8_t>(Low32(lua_tonumber(L, 3)));
    }
    return 0;
}

int ToString(lua_State* L) {
    if (const MemBlock* block = Self(L)) {
        // As a number: a size may be too large for %d.
        lua_pushfstring(L, "MemBlock (%f bytes)", static_cast<double>(block->m_Size));
    } else {
        lua_pushnil(L);
    }
    return 1;
}

int Collect(lua_State* L) {
    if (MemBlock** slot = SlotOf(L, 1, lua_upvalueindex(1))) {
        FreeBlock(std::exchange(*slot, nullptr));
    }
    return 0;
}

// The metatable goes into the registry when it is complete: a block is never without its __gc.
void PushMetatable(lua_State* L) {
    constexpr luaL_Reg kMethods[] = {
        {"__gc", Collect}, {"__index", Index}, {"__newindex", NewIndex}, {"__tostring", ToString}};
    luaL_getmetatable(L, kTypeName);
    if (lua_istable(L, -1)) return;
    lua_pop(L, 1);
    lua_createtable(L, 0, 4);
    for (const luaL_Reg& method : kMethods) {
        lua_pushvalue(L, -1);
        lua_pushcclosure(L, method.func, 1);
        lua_setfield(L, -2, method.name);
    }
    lua_pushvalue(L, -1);
    lua_setfield(L, LUA_REGISTRYINDEX, kTypeName);
}

// Bytes of new blocks that no step of a collector has paid for yet, and whether one is under way:
// its finalisers may make blocks, too.
thread_local size_t t_NumUnpaid = 0;
thread_local bool t_IsStepping = false;

int Step(lua_State* L) {
    lua_gc(L, LUA_GCSTEP, static_cast<int>(lua_tonumber(L, 1)));
    return 0;
}

// The collector sees a few words of a block. Told of its bytes now and then, it keeps up with
// scripts that drop blocks. One that a script has stopped stays so, but for plain Lua, which cannot
// be asked.
void TellCollector(lua_State* L, size_t bytes) {
    constexpr size_t kEach = 65536;
    t_NumUnpaid += bytes;
    if (t_NumUnpaid < kEach || t_IsStepping || lua_gc(L, LUA_GCISRUNNING, 0) == 0) return;
    lua_pushcfunction(L, Step);
    lua_pushnumber(L, static_cast<double>(t_NumUnpaid >> 10));
    t_NumUnpaid = 0;
    t_IsStepping = true;
    if (lua_pcall(L, 1, 0, 0) != 0) lua_pop(L, 1);  // a finaliser has failed
    t_IsStepping = false;
}

// MemBlock(n): n bytes, all zero. No result for anything but a number from 1 to what 32 bits hold.
int CreateMemBlock(lua_State* L) {
    double size = lua_tonumber_def(L, 1, 0);
    if (!(size >= 1 && size < 0x1p32)) return 0;
    return PushMemBlock(L, MemBlock(nullptr, static_cast<uint32_t>(size)));
}

// Reads hexadecimal numbers with white space between them, up to where anything else stands, and
// returns how many there are. Their low 8 bits go to `bytes`, unless it is null.
uint32_t ReadHex(const char* text, uint8_t* bytes) {
    for (uint32_t count = 0;;) {
        char* end;
        long number = strtol(text, &end, 16);
        if (end == text) return count;
        if (bytes) bytes[count] = static_cast<uint8_t>(number);
        count++;
        if (!isspace(static_cast<unsigned char>(*end))) return count;
        text = end;
    }
}

// HexData(text): the bytes that the text writes down. No result for anything but a string.
int HexData(lua_State* L) {
    if (lua_type(L, 1) != LUA_TSTRING) return 0;
    const char* text = lua_tostring(L, 1);
    if (!PushMemBlock(L, MemBlock(nullptr, ReadHex(text, nullptr)))) return 0;
    MemBlock* block = *static_cast<MemBlock**>(lua_touserdata(L, -1));
    ReadHex(text, static_cast<uint8_t*>(block->m_Ptr));
    return 1;
}

}  // namespace

MemBlock* NewMemBlock(const MemBlock& bytes) {
    auto* block = static_cast<MemBlock*>(g_ReusePoolMgr.Alloc(sizeof(MemBlock)));
    if (!block) return nullptr;
    *block = MemBlock(bytes.m_Size ? g_ReusePoolMgr.Alloc(bytes.m_Size) : nullptr, bytes.m_Size);
    if (!bytes.m_Size) return block;
    if (!block->m_Ptr) return FreeBlock(block), nullptr;
    if (bytes.m_Ptr) {
        memcpy(block->m_Ptr, bytes.m_Ptr, bytes.m_Size);
    } else {
        memset(block->m_Ptr, 0, bytes.m_Size);
    }
    return block;
}

bool PushMemBlock(lua_State* L, const MemBlock& bytes) {
    luaL_checkstack(L, 4, "no room for a block of bytes");
    TellCollector(L, bytes.m_Size);
    // The userdata stands before it is given anything: from then on no call can raise.
    auto** slot = static_cast<MemBlock**>(lua_newuserdata(L, sizeof(MemBlock*)));
    *slot = nullptr;
    PushMetatable(L);
    lua_setmetatable(L, -2);
    *slot = NewMemBlock(bytes);
    if (*slot) return true;
    lua_pop(L, 1);
    return false;
}

MemBlock* ToMemBlock(lua_State* L, int index) {
    luaL_getmetatable(L, kTypeName);
    MemBlock** slot = SlotOf(L, index, lua_gettop(L));
    lua_pop(L, 1);
    return slot ? *slot : nullptr;
}

void register_memblock(lua_State* L) {
    luaL_checkstack(L, 4, "no room for the type of byte blocks");
    PushMetatable(L);
    lua_pop(L, 1);
    lua_pushcfunction(L, HexData);
    lua_setglobal(L, "HexData");
    lua_pushcfunction(L, CreateMemBlock);
    lua_setglobal(L, "MemBlock");
}

}  // namespace Korvel

#include <cstring>
#include <lua.hpp>

#include "core/0ReusePool.h"
#include "core/MemBlock.h"
#include "core/OxID.h"
#include "core/ScriptVal.h"
#include "diag/Env.h"
#include "runtime/lua/KRScriptLibInternal.h"
#include "runtime/lua/LuaCodeInternal.h"
#include "runtime/lua/LuaMemBlockInternal.h"
#include "runtime/lua/LuaValues.h"

namespace Korvel {
namespace {

EnvBool s_AllowRemoteCode("KORVEL_AllowRemoteCode", true, false);

// Bytes that a dump adds to. No destructor: it lives across calls of Lua, which raise no errors.
struct DumpBuffer {
    uint32_t m_Capacity;
    uint32_t m_Length;
    char* m_Data;
    bool m_IsFull;  // there was no memory for all

    bool Reserve(size_t size);
    void Free() { g_ReusePoolMgr.Free(m_Data); }
};

bool DumpBuffer::Reserve(size_t size) {
    if (size <= m_Capacity) return true;
    size_t capacity = m_Capacity ? m_Capacity : 32;
    while (capacity < size) capacity *= 2;
    auto* data =
        capacity <= UINT32_MAX ? static_cast<char*>(g_ReusePoolMgr.Alloc(capacity)) : nullptr;
    if (!data) return false;
    if (m_Length) memcpy(data, m_Data, m_Length);
    Free();
    m_Data = data;
    m_Capacity = static_cast<uint32_t>(capacity);
    return true;
}

// What lua_dump calls; 0 is success.
int writer(lua_State*, const void* bytes, size_t size, void* pointer) {
    auto& buffer = *static_cast<DumpBuffer*>(pointer);
    if (!size) return 0;
    buffer.m_IsFull = !buffer.Reserve(buffer.m_Length + size);
    if (buffer.m_IsFull) return 1;
    memcpy(buffer.m_Data + buffer.m_Length, bytes, size);
    buffer.m_Length += static_cast<uint32_t>(size);
    return 0;
}

struct CompileJob {
    int (*m_Load)(lua_State* L, const char* source);
    const char* m_Source;
    MemBlock* m_Code;
};

// The chunk without what only helps to find errors in it.
int Compile(lua_State* L) {
    auto& job = *static_cast<CompileJob*>(lua_touserdata(L, 1));
    luaL_openlibs(L);
    lua_getglobal(L, "string");
    lua_getfield(L, -1, "dump");
    if (job.m_Load(L, job.m_Source) != 0) return lua_error(L);
    lua_pushboolean(L, true);
    lua_call(L, 2, 1);
    size_t length;
    const char* code = luaL_checklstring(L, -1, &length);
    job.m_Code = NewMemBlock({const_cast<char*>(code), static_cast<uint32_t>(length)});
    return job.m_Code ? 0 : luaL_error(L, "not enough memory");
}

MemBlock* ToCode(int (*load)(lua_State*, const char*), const char* source, OxID& error) {
    CompileJob job{load, source, nullptr};
    lua_State* L = source ? luaL_newstate() : nullptr;
    if (!L) {
        error = source ? "not enough memory" : "there is nothing to compile";
        return nullptr;
    }
    if (lua_cpcall(L, Compile, &job) != 0) {
        const char* message = lua_tostring(L, -1);
        error.PrintF("%s", message ? message : "unknown error");
    }
    lua_close(L);
    return job.m_Code;
}

}  // namespace

bool ReadCode(lua_State* L, int index, ScriptVal& value) {
    DumpBuffer buffer = {};
    lua_pushvalue(L, index);
    bool isDumped = lua_dump(L, writer, &buffer) == 0;
    lua_pop(L, 1);
    if (isDumped) {
        value = ScriptVal(buffer.m_Data, buffer.m_Length, 0);
    } else {
        value = SV_Nil;
    }
    buffer.Free();
    return isDumped ? value.IsCode() : !buffer.m_IsFull;
}

bool MayRunCode(const ScriptVal& code) {
    return !(code.m_Flags & SVF_ForeignCode) || s_AllowRemoteCode;
}

void PushCodeResults(lua_State* L, const ScriptVal& code, int numResults) {
    luaL_checkstack(L, LUA_MINSTACK, "no room for code");
    const char* bytes = code.ToCodePtr() ? static_cast<const char*>(code.ToCodePtr()) : "";
    if (luaL_loadbuffer(L, bytes, code.ToCodeLen(), "<code>") != 0 ||
        lua_pcall(L, 0, numResults, 0) != 0) {
        Alert(L);
        lua_pushnil(L);
    }
}

MemBlock* lua_StrToCode(const char* text, OxID& error, TagList*) {
    return ToCode([](lua_State* L, const char* source) { return luaL_loadstring(L, source); }, text,
                  error);
}

MemBlock* lua_FileToCode(const char* file, OxID& error, TagList*) {
    return ToCode([](lua_State* L, const char* name) { return luaL_loadfile(L, name); }, file,
                  error);
}

}  // namespace Korvel

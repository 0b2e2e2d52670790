#include <exception>
#include <new>

#include "runtime/lua/KRScriptLibInternal.h"

namespace Korvel {

extern const char kLegacyScript[];        // scripts/legacy.lua
extern const char kOrderedTableScript[];  // scripts/orderedtable.lua

namespace {

constinit EmbeddedScript s_Scripts[] = {EmbeddedScript(kLegacyScript)};
constinit EmbeddedScript s_OrderedTable(kOrderedTableScript);

int Append(lua_State*, const void* bytes, size_t size, void* bytecode) {
    try {
        static_cast<std::string*>(bytecode)->append(static_cast<const char*>(bytes), size);
        return 0;
    } catch (const std::exception&) {
        return 1;
    }
}

void Run(lua_State* L, EmbeddedScript& script) {
    if (script.Load(L) != 0 || lua_pcall(L, 0, 0, 0) != 0) Alert(L);
}

}  // namespace

void Alert(lua_State* L) {
    PushGlobalRaw(L, "_ALERT");
    lua_insert(L, -2);
    if (lua_pcall(L, 1, 0, 0) != 0) lua_pop(L, 1);
}

int EmbeddedScript::Load(lua_State* L) {
    if (const std::string* bytecode = m_Bytecode.load(std::memory_order_acquire)) {
        return luaL_loadbuffer(L, bytecode->data(), bytecode->size(), m_Text);
    }
    int status = luaL_loadstring(L, m_Text);
    if (status == 0) KeepBytecode(L);
    return status;
}

// Of the function on top of the stack. Nothing here raises a Lua error.
void EmbeddedScript::KeepBytecode(lua_State* L) {
    auto* bytecode = new (std::nothrow) std::string;
    const std::string* none = nullptr;
    if (!bytecode || lua_dump(L, Append, bytecode) != 0 ||
        !m_Bytecode.compare_exchange_strong(none, bytecode)) {
        delete bytecode;
    }
}

void RunStartupScripts(lua_State* L) {
    for (EmbeddedScript& script : s_Scripts) Run(L, script);
}

void RunOrderedTableScript(lua_State* L) {
    Run(L, s_OrderedTable);
}

}  // namespace Korvel

#include "objects/LuaClass.h"

#include <cstdio>
#include <lua.hpp>

#include "runtime/lua/LuaType.h"

namespace Korvel {
namespace {

int IllegalOperator(lua_State* L) {
    return luaL_error(L, "Illegal operator");
}

// The root of all types.
class LuaType_LuaClass : public LuaTypeT<LuaClass> {
public:
    using LuaTypeT::LuaTypeT;

    int lw_create(lua_State*) override { return 0; }
    int lw_typename(lua_State* L, void*, LuaType* type) override {
        lua_pushstring(L, type->GetName());
        return 1;
    }
    int lw_istypeof(lua_State* L, void*, LuaType* type) override {
        const char* name = lua_tostring_def(L, -1, nullptr);
        lua_pushboolean(L, type->FindType(name) != nullptr);
        return 1;
    }
    int lw_tostring(lua_State* L, void* object, LuaType* type) override {
        char address[32];  // Lua's own "%p" differs from one interpreter to the next
        snprintf(address, sizeof(address), "%p", object);
        lua_pushfstring(L, "%s <%s>", type->GetName(), address);
        return 1;
    }
    int lw_call(lua_State*, void*, LuaType*) override { return 0; }
    int lw_newindex(lua_State*, void*, LuaType*) override { return 0; }
    int lw_index(lua_State* L, void*, LuaType*) override {
        lua_pushnil(L);
        return 1;
    }
    int lw_add(lua_State* L, void*, LuaType*) override { return IllegalOperator(L); }
    int lw_sub(lua_State* L, void*, LuaType*) override { return IllegalOperator(L); }
    int lw_mul(lua_State* L, void*, LuaType*) override { return IllegalOperator(L); }
    int lw_div(lua_State* L, void*, LuaType*) override { return IllegalOperator(L); }
    int lw_pow(lua_State* L, void*, LuaType*) override { return IllegalOperator(L); }
    int lw_unm(lua_State* L, void*, LuaType*) override { return IllegalOperator(L); }
    int lw_eq(lua_State* L, void* object, LuaType*) override {
        lua_pushboolean(L, lua_totype(L, 1, GetName()) == object);
        return 1;
    }
    int lw_lt(lua_State* L, void*, LuaType*) override { return IllegalOperator(L); }
    int lw_le(lua_State* L, void*, LuaType*) override { return IllegalOperator(L); }
    int lw_concat(lua_State* L, void*, LuaType*) override { return IllegalOperator(L); }
    int lw_use(lua_State*, void*, LuaType*) override { return 0; }
    int lw_recycle(lua_State*, void*, LuaType*) override { return 0; }
};

LuaType_LuaClass s_LuaType_LuaClass("LuaClass", nullptr, nullptr, nullptr);

}  // namespace

constinit LuaType& LuaClass::s_LuaType = s_LuaType_LuaClass;

int LuaClass::lw_push(lua_State* L) {
    lua_pushnil(L);
    return 1;
}

}  // namespace Korvel

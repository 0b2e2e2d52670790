#include "objects/LuaClass.h"

#include <lua.hpp>

namespace Korvel {

int LuaClass::lw_push(lua_State* L) {
    lua_pushnil(L);
    return 1;
}

}  // namespace Korvel

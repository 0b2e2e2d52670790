#pragma once

#include "core/Export.h"

struct lua_State;

namespace Korvel {

class LuaType;

// The part of an object that Lua sees.
class KORVEL_EXPORT LuaClass {
public:
    virtual ~LuaClass() = default;

    // Pushes the object to Lua; the base pushes nil. Returns the number of values pushed, 1.
    virtual int lw_push(lua_State* L);

    // The root of all Lua types, named "LuaClass".
    static LuaType& s_LuaType;
};

}  // namespace Korvel

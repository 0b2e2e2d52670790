#include <dlfcn.h>

#include "runtime/lua/LuaGuardInternal.h"

namespace Korvel {
namespace {

// The file that a function lies in.
const void* FileOf(void* function) {
    Dl_info info;
    return dladdr(function, &info) ? info.dli_fbase : nullptr;
}

}  // namespace

bool IsLuaJIT() {
    static const bool isLuaJIT = FileOf(reinterpret_cast<void*>(lua_newstate)) ==
                                 FileOf(reinterpret_cast<void*>(luaJIT_setmode));
    return isLuaJIT;
}

}  // namespace Korvel

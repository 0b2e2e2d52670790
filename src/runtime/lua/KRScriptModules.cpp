// Where interpreters find modules: in the resource store, and along the search paths.
#include "Platform/Files.h"
#include "Platform/Processes.h"
#include "core/OxString.h"
#include "runtime/RuntimeHooksInternal.h"
#include "runtime/lua/KRScriptLib.h"
#include "runtime/lua/KRScriptLibInternal.h"

namespace Korvel {
namespace {

// The places of a module in the resource store; %s is its name with slashes for dots.
constexpr const char* kModulePaths[] = {
    ":/Resources/KorvelScript/%s.lua",
    ":/Resources/KorvelScript/%s/init.lua",
    ":/Resources/KorvelScript/%s/%s.lua",
};

// What a search path becomes: the setting of the environment, in which ";;" takes in `path`, or
// else `path`; a "!" stands for the folder of this library.
OxStringT<char> ExpandPath(const char* envName, const char* path) {
    OxStringT<char> result;
    if (Platform::GetEnv(envName, result)) {
        result.Replace(";;", ";\1;");
        result.Replace("\1", path);
    } else {
        result = path;
    }
    char folder[Platform::kMaxPath];
    if (Platform::GetSystemFolder(Platform::SF_Library, folder, sizeof(folder))) {
        result.Replace("!", folder);
    }
    return result;
}

int PushText(lua_State* L) {
    lua_pushstring(L, *static_cast<const OxStringT<char>*>(lua_touserdata(L, 1)));
    return 1;
}

}  // namespace

int myloader(lua_State* L) {
    const char* name = luaL_gsub(L, luaL_checkstring(L, 1), ".", "/");
    for (const char* place : kModulePaths) {
        const char* path = lua_pushfstring(L, place, name, name);
        std::string_view content;
        if (g_RuntimeHooks.m_FindResource(path, content)) {
            luaL_loadbuffer(L, content.data(), content.size(), name);
            return 1;  // the chunk, or what is wrong with it
        }
        lua_pop(L, 1);
    }
    return 0;
}

void SetLuaPath(lua_State* L, const char* field, const char* envName, const char* value) {
    lua_getglobal(L, "package");
    lua_pushcfunction(L, PushText);
    int status;
    {
        OxStringT<char> path = ExpandPath(envName, value);
        lua_pushlightuserdata(L, &path);
        status = lua_pcall(L, 1, 1, 0);
    }
    if (status != 0) lua_error(L);
    lua_setfield(L, -2, field);
    lua_pop(L, 1);
}

void require(lua_State* L, const char* name, bool setGlobal) {
    lua_getglobal(L, "require");
    lua_pushstring(L, name);
    if (lua_pcall(L, 1, 1, 0) == 0 && setGlobal) {
        lua_setglobal(L, name);
    } else {
        lua_pop(L, 1);
    }
}

}  // namespace Korvel

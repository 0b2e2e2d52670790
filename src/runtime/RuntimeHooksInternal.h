#pragma once

#include <string_view>

#include "core/OxString.h"

struct lua_State;

namespace Korvel {

class RemoteApp;
class ScriptVal;

// What script states ask of other layers: connections, the resource store, path maps, the bindings
// of native classes. Each hook stands here with an answer that is safe while its layer is not
// there; the layer sets its own while the library loads, before other threads run.
struct RuntimeHooks {
    // The connection follows a state: whether it prints what it does, and the state's data.
    void (*m_SetAppTrace)(RemoteApp*, bool trace) = [](RemoteApp*, bool) {};
    void (*m_SetStateData)(RemoteApp*, const ScriptVal& data) = [](RemoteApp*, const ScriptVal&) {};

    // The content of a resource, which lives as long as the process; false when there is none.
    bool (*m_FindResource)(const char* path, std::string_view& content) =
        [](const char*, std::string_view&) { return false; };

    // Expands a list of paths by a path map; false leaves `out` alone.
    bool (*m_MapPaths)(const char* paths, const ScriptVal& map, OxStringT<char>& out) =
        [](const char*, const ScriptVal&, OxStringT<char>&) { return false; };

    // Builds the bindings of native classes in an interpreter, into the table at `index`. May raise
    // Lua errors.
    void (*m_InitFFI)(lua_State* L, int index) = [](lua_State*, int) {};
};

extern RuntimeHooks g_RuntimeHooks;

}  // namespace Korvel

#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>

#include "core/Export.h"

struct lua_State;

namespace Korvel {

class RemoteApp;
class ScriptObject;
class ScriptVal;
class TagList;

namespace KorvelScript {
class ScriptState;
enum eSCSetupState : unsigned int;
}  // namespace KorvelScript

// Bits of ScriptConfig::m_Flags.
constexpr uint32_t SCF_Host = 1;       // listens, and registers with the script server
constexpr uint32_t SCF_Standard = 2;   // set by every configuration
constexpr uint32_t SCF_LocalOnly = 4;  // uses the script server of this machine alone

// How a host is asked for what only it knows. The host fills the record, owns it, and keeps it
// unchanged as long as scripting is in use. Every callback may be null.
//
// Threads: callbacks come on any thread.
struct ScriptConfig {
    using UIFunction = unsigned long long (*)(void* a, void* b);

    uint32_t m_Version = 2;  // 1 for a record that ends with Setup
    uint32_t m_Flags = SCF_Standard;
    const char* m_AppName = nullptr;    // as peers and the script server see it
    void* m_UserData = nullptr;         // passed to the callbacks
    std::atomic<bool> m_Active{false};  // the library's: requests go through UIExecute

    // Whether members for debug mode are there. Null is no.
    bool (*IsDebugMode)(void* userData, TagList* tags) = nullptr;
    // The application's object, borrowed. Null to a peer that asks refuses its connection.
    ScriptObject* (*GetApp)(void* userData, TagList* tags) = nullptr;
    void (*OnConnect)(void* userData, RemoteApp* app, TagList* tags) = nullptr;
    void (*OnDisconnect)(void* userData, RemoteApp* app, TagList* tags) = nullptr;
    void (*OnConnectFailed)(void* userData, RemoteApp* app, TagList* tags) = nullptr;
    // Convert the host's own kinds of Lua values; false leaves a value to the library.
    bool (*FromLua)(lua_State* L, int index, ScriptVal& value, void* userData,
                    TagList* tags) = nullptr;
    bool (*ToLua)(RemoteApp* app, lua_State* L, ScriptVal& value, void* userData,
                  TagList* tags) = nullptr;
    // Runs function(a, b) on the UI thread. With `wait` it returns the function's result when that
    // has run, without it returns 0 at once.
    unsigned long long (*UIExecute)(UIFunction function, void* a, void* b, bool wait) = nullptr;
    // A script state comes or goes.
    void (*Setup)(KorvelScript::ScriptState* state, KorvelScript::eSCSetupState stage,
                  void* userData, TagList* tags) = nullptr;

    // From version 2 on

    // Whether a peer may use this process, on the thread of the peer's call: the UI thread, where
    // there is one. Until it has said yes once, the peer can introduce itself and log in, and
    // nothing else; but one that this process has called, whoever that turned out to be, can use
    // the objects that it has been given, and a script server can ask for GetPingInfo. Both texts
    // are as the peer sent them, empty for none. Null lets everybody in. Never asked within the
    // process.
    bool (*Login)(void* userData, RemoteApp* app, const char* user, const char* password,
                  TagList* tags) = nullptr;

    bool WantsLogin() const { return m_Version >= 2 && Login; }
};

static_assert(offsetof(ScriptConfig, m_AppName) == 8 && offsetof(ScriptConfig, m_Active) == 24 &&
              offsetof(ScriptConfig, IsDebugMode) == 32 && offsetof(ScriptConfig, Login) == 104 &&
              sizeof(ScriptConfig) == 112);

// The installed configuration, borrowed from the host; null when there is none.
KORVEL_EXPORT extern std::atomic<ScriptConfig*> g_ScriptConfig;

// True until a host that runs a UI thread sets it to false: it then supplies UIExecute, and calls
// to members without SSF_AnyThread run on that thread alone.
KORVEL_EXPORT extern std::atomic<bool> g_NoGUI;

// The id of the UI thread; at first that of the thread that loaded the library.
KORVEL_EXPORT extern std::atomic<unsigned long long> g_GUIThread;
KORVEL_EXPORT unsigned long long GetGUIThread();
KORVEL_EXPORT void SetGUIThread(unsigned long long threadID);
KORVEL_EXPORT bool IsGUIThread();

// Ask the configuration; false or null without one.
KORVEL_EXPORT bool IsDebugMode();
KORVEL_EXPORT ScriptObject* GetAppObject();  // borrowed

}  // namespace Korvel

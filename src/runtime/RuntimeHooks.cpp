#include "remote/Packets.h"
#include "remote/RemoteApp.h"
#include "runtime/RuntimeHooksInternal.h"

namespace Korvel {

constinit RuntimeHooks g_RuntimeHooks;

[[maybe_unused]] static const bool s_HasConnections = [] {
    g_RuntimeHooks.m_SetAppTrace = [](RemoteApp* app, bool trace) {
        if (trace) {
            app->SetFlags(PKF_Trace);
        } else {
            app->ClearFlags(PKF_Trace);
        }
    };
    g_RuntimeHooks.m_SetStateData = [](RemoteApp* app, const ScriptVal& data) {
        app->SetStateData(data);
    };
    return true;
}();

}  // namespace Korvel

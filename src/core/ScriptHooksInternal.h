#pragma once

#include <cstdint>

#include "core/ScriptVal.h"

namespace Korvel {

// What values and objects ask of the layers above them: connections, proxies, the log. Each hook
// stands here with an answer that is safe while its layer is not there; the layer sets its own
// while the library loads, before other threads run.
struct ScriptHooks {
    // A use of a connection.
    void (*m_UseApp)(RemoteApp*) = [](RemoteApp*) {};
    void (*m_RecycleApp)(RemoteApp*) = [](RemoteApp*) {};
    bool (*m_IsConnected)(RemoteApp*) = [](RemoteApp*) { return false; };

    // Proxies.
    void (*m_IncRemoteRef)(RemoteObject*) = [](RemoteObject*) {};
    void (*m_DecRemoteRef)(RemoteObject*) = [](RemoteObject*) {};
    RemoteApp* (*m_GetRemoteApp)(RemoteObject*) = [](RemoteObject*) -> RemoteApp* {
        return nullptr;
    };
    // The object that a proxy stands for when that is one of this process, else null.
    ScriptObject* (*m_GetLocalPointer)(RemoteObject*) = [](RemoteObject*) -> ScriptObject* {
        return nullptr;
    };
    bool (*m_IsSameRemote)(RemoteObject*, RemoteObject*) = [](RemoteObject* a, RemoteObject* b) {
        return a == b;
    };

    // Sends a command to the object and waits for the reply; false when there was none.
    bool (*m_DoCommand)(RemoteObject*, int opcode, ScriptArgs&, ScriptVal& reply) =
        [](RemoteObject*, int, ScriptArgs&, ScriptVal&) { return false; };
    bool (*m_DoCommandAsync)(RemoteObject*, int opcode, ScriptArgs&, AsyncCallback, void* context) =
        [](RemoteObject*, int, ScriptArgs&, AsyncCallback, void*) { return false; };
    // Sends the list as the reply to its call.
    bool (*m_SendReply)(ScriptArgs&) = [](ScriptArgs&) { return false; };

    // The calling thread begins or ends a wait for the UI thread.
    void (*m_SetWaitingForUI)(bool isWaiting) = [](bool) {};

    // Takes an object that goes away out of the tables of exported objects. Called with no lock
    // held. The result is ClearObjectReferences' own.
    bool (*m_ForgetExports)(ScriptObject*, bool dropCounts) = [](ScriptObject*, bool) {
        return false;
    };

    // Puts an object's memory into the crash report.
    void (*m_IncludeMemory)(void* memory, unsigned int size) = [](void*, unsigned int) {};

    // Writes one line, without its end, to the log.
    void (*m_Log)(const char* line) = LogToStandardError;

    static void LogToStandardError(const char* line);
};

extern ScriptHooks g_ScriptHooks;

}  // namespace Korvel

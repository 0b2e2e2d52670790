#pragma once

#include <atomic>

#include "core/Export.h"
#include "core/ScriptVal.h"

namespace Korvel {

class ConnectApp;
class TagList;
struct ScriptConfig;

namespace Platform {
struct _Socket;
}

// Starting and stopping scripting in a process.
//
// Threads: one at a time for InitScripting to CleanupScripting; in a host with a UI thread not that
//          one, which the end of members and of connections may need. All else: any.

// Installs the host's configuration, which must outlive scripting, and makes the calling thread the
// UI thread. Does nothing where one is installed. The list is not used.
KORVEL_EXPORT void InitScripting(ScriptConfig& config, TagList* tags = nullptr);

// The same, leaving the UI thread as it is.
KORVEL_EXPORT void _InitScripting(ScriptConfig& config, TagList* tags = nullptr);

// Starts scripting as the installed configuration says. A host (SCF_Host) publishes the members
// that peers introduce themselves with on its application's object, and listens on the first free
// port from 49152 on, at the address that KORVEL_ListenAddress names, any by default. From then on
// requests of peers go through UIExecute.
//   hostInfo  a table of what others are told of this host; anything else counts as an empty one
//   returns   false without a configuration, and when the host cannot listen, with the reason in
//             the log; true, with nothing done, when scripting has been started. Where every port
//             is taken, the host runs without one: GetListenPort is 0.
KORVEL_EXPORT bool StartScripting(const ScriptVal& hostInfo, TagList* tags = nullptr);

// Undoes that. Connections that are open stay open, and their requests do not go through UIExecute
// any more. It can be started again. Does nothing where scripting has not been started.
KORVEL_EXPORT void StopScripting(TagList* tags = nullptr);

// For the end of a host: StopScripting, then ends all connections, for which it waits up to two
// seconds. Members that run meanwhile may need the UI thread, so UIExecute works until it returns.
KORVEL_EXPORT void CleanupScripting(TagList* tags = nullptr);

// Set by a host that is known to its peers as "Torvane", whatever its m_AppName says.
KORVEL_EXPORT extern std::atomic<bool> g_IsTorvane;

// Whether scripting has been started.
KORVEL_EXPORT extern std::atomic<bool> g_ScriptingActive;

// What others are told of this host, a table: what StartScripting was given, and "Name",
// "ProcessID", "UUID" and "Port". Written by StartScripting alone.
KORVEL_EXPORT extern ScriptVal g_HostInfo;

// The port at which this process listens; 0 when it does not.
KORVEL_EXPORT unsigned int GetListenPort();

// Makes a connection of a socket at which a peer has called, and takes the socket over. The
// connection needs no owner; what is returned is borrowed, and gone when the peer is. Null when
// there is no connection, and for kInProcess: within the process RemoteApp::Connect makes both
// ends.
KORVEL_EXPORT ConnectApp* AcceptListen(Platform::_Socket* socket);

// The UUID of this process, a text. It is made at first need and stays.
KORVEL_EXPORT const ScriptVal& GetAppUUID();

}  // namespace Korvel

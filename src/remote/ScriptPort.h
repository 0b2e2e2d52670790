#pragma once

#include <atomic>

#include "core/Export.h"
#include "core/ScriptVal.h"

namespace Korvel {

class ConnectApp;
class OxID;
class RemoteApp;
class ScriptObject;
class TagList;
struct ScriptConfig;

namespace Platform {
struct _Socket;
}

// Starting and stopping scripting in a process.
//
// Threads: one at a time for InitScripting to CleanupScripting. In a host with a UI thread not that
//          one for StopScripting and CleanupScripting: the end of members and of connections may
//          need it. All else: any.

// Installs the host's configuration, which must outlive scripting, and makes the calling thread the
// UI thread. Does nothing where one is installed. The list is not used.
KORVEL_EXPORT void InitScripting(ScriptConfig& config, TagList* tags = nullptr);

// The same, leaving the UI thread as it is.
KORVEL_EXPORT void _InitScripting(ScriptConfig& config, TagList* tags = nullptr);

// Starts scripting as the installed configuration says. A host (SCF_Host) publishes the members
// that peers introduce themselves with on its application's object, and listens on the first free
// port from 49152 on, at the address that KORVEL_ListenAddress names, any by default. From then on
// requests of peers go through UIExecute. Then it registers with the script server of its machine,
// by which others find it; where none answers, it starts one, unless it has no m_AppName.
//
// A host that cannot register is reached by its port alone. Without a server and the tool that is
// one that shows at once; a server that does not answer is waited for ten seconds, and some seconds
// more where it has taken the call. After that, and whenever the connection to the server ends, the
// host tries again after KORVEL_RegisterAgainSeconds (10) and up to half as much, until it stops.
//   hostInfo  a table of what others are told of this host; anything else counts as an empty one
//   returns   false without a configuration, and when the host cannot listen, with the reason in
//             the log; true, with nothing done, when scripting has been started. Where every port
//             is taken, the host runs without one: GetListenPort is 0, and others are told 65536.
KORVEL_EXPORT bool StartScripting(const ScriptVal& hostInfo, TagList* tags = nullptr);

// The same for a host that must not block: what has to be done on the UI thread is queued with
// UIExecute, and registering goes on beside it. g_ScriptingActive tells when all is done.
KORVEL_EXPORT void DeferStartScripting(const ScriptVal& hostInfo, TagList* tags = nullptr);

// Starts the script server of this machine; where one runs, the second one ends by itself. It has
// nothing of this process but its environment, outlives it and writes nothing, but for its log. The
// tool that is the server is `oxscript`: KORVEL_Tool names another file, else it stands beside the
// library, in ../bin or ../../bin from there, or in PATH.
//   returns  false, with a line in the log, when there is no tool, or it cannot be started
KORVEL_EXPORT bool StartServer(TagList* tags = nullptr);

// The proxy of the script server with which this host is registered, else nil; and what registering
// has last returned.
KORVEL_EXPORT ScriptVal GetServer();
KORVEL_EXPORT ScriptVal GetHost();

// Calls the member `name` of all hosts of this machine with `args`, on this one only if asked. It
// does not wait for them. Always true.
KORVEL_EXPORT bool NotifyHosts(const OxID& name, ScriptVal args, bool includeSelf);

// Calls a member of each target and does not wait for an answer. `target` is a proxy, or a table
// with proxies among its values. `args` has the name at key 0 and the arguments from 1 on. In a
// table, the proxies of the connection `exclude` are left out.
KORVEL_EXPORT void SendNotify(const ScriptVal& target, ScriptArgs& args,
                              RemoteApp* exclude = nullptr);
// The same with an object, which may be null, and eight values.
KORVEL_EXPORT void SendNotify(const ScriptVal& target, const char* name, ScriptObject* object,
                              const ScriptVal& v1, const ScriptVal& v2, const ScriptVal& v3,
                              const ScriptVal& v4, const ScriptVal& v5, const ScriptVal& v6,
                              const ScriptVal& v7, const ScriptVal& v8, TagList* tags = nullptr);
KORVEL_EXPORT void SendNotifyExclude(RemoteApp* exclude, const ScriptVal& target, const char* name,
                                     ScriptObject* object, const ScriptVal& v1, const ScriptVal& v2,
                                     const ScriptVal& v3, const ScriptVal& v4, const ScriptVal& v5,
                                     const ScriptVal& v6, const ScriptVal& v7, const ScriptVal& v8,
                                     TagList* tags = nullptr);

// A host counts those of its threads that wait for the UI thread.
KORVEL_EXPORT void SetWaitingForUI(bool isWaiting);
KORVEL_EXPORT bool IsWaitingForUI();

// Of other systems; no effect, and false.
KORVEL_EXPORT bool IsListenPortActive();
KORVEL_EXPORT void _RemoveScriptObject(void* object, TagList* tags = nullptr);

// Undoes that, also when it is still under way. The script server is told, if it answers within a
// second. Connections that are open stay open, but for the one to it, and their requests do not go
// through UIExecute any more. It can be started again. Does nothing where scripting has not been
// started.
KORVEL_EXPORT void StopScripting(TagList* tags = nullptr);

// For the end of a host: StopScripting, then ends all connections, for which it waits up to two
// seconds. Members that run meanwhile may need the UI thread, so UIExecute works until it returns.
KORVEL_EXPORT void CleanupScripting(TagList* tags = nullptr);

// Set by a host that is known to its peers as "Torvane", whatever its m_AppName says.
KORVEL_EXPORT extern std::atomic<bool> g_IsTorvane;

// Whether scripting has been started. Who waits for that is notified.
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

#pragma once

#include "Platform/Lock.h"
#include "core/Export.h"
#include "core/ScriptVal.h"

namespace Korvel {

namespace Platform {
struct _Socket;
}

// How connections are made, and all that have been made here. Each function gives a proxy of the
// peer's application object, or nil, with the reason in the log. The proxy holds the connection,
// which ends with the last object that either side has of the other.
//
// Threads: any but those of connections. Connecting may wait as long as told, with no lock held.

// Connects by address (in network order) and port. The peer tells who it is.
//   reply    takes what it tells: a table with its "Name" and "UUID", and what it wants this
//            process to know; nil without an answer
//   timeOut  in seconds, for the connection and then for each call through it; 0 has no limit
KORVEL_EXPORT ScriptVal ScriptApp(unsigned int ip, unsigned int port, ScriptVal& reply);
KORVEL_EXPORT ScriptVal ScriptApp(unsigned int ip, unsigned int port, ScriptVal& reply,
                                  double timeOut);

// Takes over a socket that is connected, for a peer that will tell who it is; without a connection
// it is closed. Until then the peer has this name, "unknown" for null, and UUID, which may be nil.
KORVEL_EXPORT ScriptVal ScriptApp(Platform::_Socket* socket, const char* name, ScriptVal uuid);
// The same into a connection of the caller's.
KORVEL_EXPORT ScriptVal ScriptApp(RemoteApp* app, Platform::_Socket* socket, const char* name,
                                  ScriptVal uuid);

// Calls `visit` with each connection that was made here and that somebody still holds, connected or
// not. It is held for the time of the call.
KORVEL_EXPORT void ForEachApp(void (*visit)(void* data, RemoteApp& app), void* data);

// The connections that were made here, linked from creation to destruction, guarded by g_AppLock.
KORVEL_EXPORT extern RemoteApp* g_AppList;
KORVEL_EXPORT extern KorvelScript::Lock& g_AppLock;

// Held for the moment in which a connection is listed, and while one is made by name: so others are
// made before or after.
KORVEL_EXPORT extern KorvelScript::Lock& g_ConnectLock;

}  // namespace Korvel

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
// Threads:  any but those of connections. Connecting may wait as long as told, with no lock held.
// Settings: KORVEL_ConnectLock (true): connections are made by name under g_ConnectLock.
//           KORVEL_EarlyConnectLock (true): only until they are listed. False keeps others waiting
//           until the attempt is over.

// Connects to the application of a name on a machine, whose script server is asked for its port.
//   name     waits until scripting has been started in this process, unless it begins with "!",
//            which is left out. So does one that is empty, but not null; with either the script
//            server itself is the peer. "Torvane" is a part of "Korvel", and its object is returned
//   subtype  may be null; which of several applications of the name it shall be: the one with the
//            highest priority under this key
//   uuid     a text, to have that very process, else nil
//   host     the address or name of the machine; with SCF_LocalOnly only this one is asked
//   timeOut  in seconds, for each step of connecting and then for each call through the
//            connection; 0 has no limit. Name servers take the time that they need
// Names longer than 127 bytes are cut. The UI thread does not wait for scripting that it has to
// start itself (DeferStartScripting): it uses "!" or comes later.
KORVEL_EXPORT ScriptVal ScriptApp(const char* name, const char* subtype, ScriptVal uuid,
                                  const char* host, double timeOut);
// Returns the proxy at once, and with `connect` goes on by RemoteApp::AsyncConnect. The name is
// taken as it is.
KORVEL_EXPORT ScriptVal AsyncScriptApp(const char* name, const char* subtype, ScriptVal uuid,
                                       const char* host, double timeOut, bool connect);

// Whether an application lets a user in, within 5 seconds for each step. The login is tried on a
// connection of its own: to use an application, call its member __Login on the proxy of that.
KORVEL_EXPORT bool ScriptLogin(const char* host, const char* name, const char* user,
                               const char* password);

// Asks the script server at an address, or all in reach by 0xFFFFFFFF, who is there, by datagram
// and without a connection. Any thread.
//   name     of an application, which only those answer that have it; empty or null for any
//   timeOut  in seconds, for all of it
//   result   becomes a list with a table for each answer, 4,096 at most: what the server tells
//            (docs/protocol.md), its "IP" and, where that was found in time, "HostName"
//   returns  false when the question cannot be sent; true also without an answer
KORVEL_EXPORT bool Ping(const char* name, double timeOut, ScriptVal& result, unsigned int ip);

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

// Held for the moment in which a connection is listed, or as the settings tell while one is made by
// name: so others are made before or after.
KORVEL_EXPORT extern KorvelScript::Lock& g_ConnectLock;

}  // namespace Korvel

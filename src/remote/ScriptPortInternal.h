#pragma once

#include "Platform/Lock.h"
#include "core/ScriptVal.h"

namespace Korvel {

class ScriptInfo;

// The steps of starting and stopping a host; for the thread that does that.

// Opens the socket at which peers call, on the first free port. False when there is no socket. When
// no port is free, there is no listener, and the port is kNoFreePort.
bool OpenListener(unsigned int& port);
constexpr unsigned int kNoFreePort = 65536;
// Accepts who calls, on a thread of its own. False when there is no thread; then it is closed.
bool StartListener(unsigned int port);
void CloseListener();

// Adds __Connect and __Login to a class, and takes them away again.
void PublishHostMembers(ScriptInfo& info);
void WithdrawHostMembers();

// What waits for the processes that this one has started, until they introduce themselves: a table
// under the id of each.
extern KorvelScript::Lock& g_ProcLock;
extern ScriptVal g_ProcIDs;  // guarded by g_ProcLock

}  // namespace Korvel

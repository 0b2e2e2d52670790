#pragma once

#include <cstdint>
#include <string>

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

// Tells the script server that this host goes, and forgets the server.
void LeaveServer();

// The path of the tool that serves as script server and runs scripts; empty, with a line in the
// log, when there is none.
std::string FindTool();

// Runs a script of a language in a process of its own, which calls this one and is given `data`.
// False, with the reason in the log, when it cannot be started.
bool StartScriptProcess(const char* language, const char* file, const ScriptVal& data);
// Waits for those that have ended.
void ReapChildren();

// What the room of the host library does at a start and at a stop.
struct StartHooks {
    void (*m_LibCurlInit)() = [] {};
    void (*m_LibCurlCleanup)() = [] {};
};
extern StartHooks g_StartHooks;

// Adds __Connect and __Login to a class, and takes them away again.
void PublishHostMembers(ScriptInfo& info);
void WithdrawHostMembers();
// Whether that is one of the two, by its name or by its function value. Any thread.
bool IsHostMember(const char* name);
bool IsHostMember(uint64_t function);

// Waits until no thread of AsyncConnect is left, or until the deadline, as NowNs tells it. True
// when there is none.
bool AwaitConnecting(int64_t deadlineNs);

// What waits for the processes that this one has started, until they introduce themselves: a table
// under the id of each.
extern KorvelScript::Lock& g_ProcLock;
extern ScriptVal g_ProcIDs;  // guarded by g_ProcLock
// Takes out what is kept under an id; nil for nothing.
ScriptVal TakeProcessDataLocked(const ScriptVal& id);

}  // namespace Korvel

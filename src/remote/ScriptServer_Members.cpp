// What the script server does for those who are connected with it.
#include "Platform/Files.h"
#include "Platform/Processes.h"
#include "diag/Debug.h"
#include "diag/Env.h"
#include "remote/ScriptServerInternal.h"

namespace Korvel {
namespace {

EnvBool s_AllowRemoteStart("KORVEL_AllowRemoteStart", true, false);

// As it may be logged and printed.
class Printable {
public:
    explicit Printable(const char* text) : m_Text(RemoteApp::CutName(text)) {}
    const char* Get() const { return m_Text; }

private:
    OxStringT<char> m_Text;
};

}  // namespace

void ScriptServerObject::IncRef() {
    m_UseCount++;
}
void ScriptServerObject::DecRef() {
    if (--m_UseCount == 0) delete this;
}

KORVEL_PUBLISH(ScriptServerObject, "ScriptServerObject", "An object of the script server.", "")
KORVEL_PUBLISHED(ScriptServerObject);

bool ScriptServerApp::AddHost(ScriptArgs& args) {
    ScriptHost host;
    RemoteApp* app = args.GetApp();
    if (!app || !HostRegistry::MakeHost(args[1], app, host)) return false;
    host.m_Proxy = app->FindRemoteObject(1);
    OxStringT<char> name = host.GetPrintName();
    auto processID = static_cast<long long>(host.m_ProcessID);
    g_ScriptServerLog.PrintF("AddHost '%s' [%u] (App = %08llx, UUID = %s): \n",
                             static_cast<const char*>(name), host.m_Port,
                             static_cast<unsigned long long>(reinterpret_cast<uintptr_t>(app)),
                             Printable(host.m_UUID.ToString("<nil>")).Get());
    if (!m_Hosts.Add(host)) {
        g_ScriptServerLog.PrintF("Too many hosts!\n");
        return false;
    }
    PrintServerLine("Host '%s' [%lld] Added\n", static_cast<const char*>(name), processID);
    g_ScriptServerLog.PrintF("Added\n");
    return true;
}

bool ScriptServerApp::RemoveHost(const ScriptVal& processID) {
    if (!processID.IsNumber()) return false;
    uint64_t wanted = HostRegistry::ToProcessID(processID);
    g_ScriptServerLog.PrintF("RemoveHost %lld: \n", static_cast<long long>(wanted));
    HostRegistry::Hosts removed = m_Hosts.Remove(wanted);
    if (removed.empty()) {
        g_ScriptServerLog.PrintF("Host not found!\n");
        return false;
    }
    OxStringT<char> name = removed.front().GetPrintName();
    PrintServerLine("Host '%s' Removed\n", static_cast<const char*>(name));
    g_ScriptServerLog.PrintF("Host '%s' removed\n", static_cast<const char*>(name));
    return true;
}

// Each on its own thread's time: nobody waits for an answer.
void ScriptServerApp::NotifyHosts(const char* name, const ScriptVal& value,
                                  const RemoteApp* butOf) {
    for (ScriptVal& proxy : m_Hosts.GetProxies(butOf)) {
        proxy.AsyncCallMember(nullptr, nullptr, name, value);
    }
}

bool ScriptServerApp::StartHost(const RemoteApp* caller, const char* name, const char* command,
                                bool force, uint64_t& processID) {
    g_ScriptServerLog.PrintF("StartHost '%s' ('%s'): \n", Printable(name).Get(),
                             Printable(command).Get());
    if (!force && m_Hosts.FindProcess(name, processID)) {
        g_ScriptServerLog.PrintF("Host found.\n");
        return true;
    }
    g_ScriptServerLog.PrintF("Host not found, running: \n");
    if (!s_AllowRemoteStart && !(caller && caller->IsPeerLocal())) {
        g_ScriptServerLog.PrintF("Other machines may not start programs here.\n");
        return false;
    }
    char folder[Platform::kMaxPath];
    bool hasFolder = Platform::GetSystemFolder(Platform::SF_Library, folder, sizeof folder);
    unsigned long long id = 0;
    Platform::_Process* process =
        Platform::NewProcess(command, hasFolder ? folder : nullptr, 0, &id);
    if (!process) return false;
    Platform::DeleteProcess(process);
    processID = id;
    return true;
}

KORVEL_PUBLISH(ScriptServerApp, "ScriptServer", "The registry of the hosts of this machine.",
               "Hosts register here with AddHost. Whoever looks for one asks for it by its name.")

KORVEL_FUNCTION(ScriptServerApp, AddHost, 0, {SYMT_ShortHelp, "Registers the caller as a host."},
                {SYMT_Usage, "Registers the caller until its connection ends."},
                {SYMT_ReturnType, "boolean"}, {SYMT_ReturnName, "done"}, {SYMT_ArgType, "table"},
                {SYMT_ArgName, "info"},
                {SYMT_ArgDesc,
                 "what others are told: Name, ProcessID, UUID, Port, PingInfo, Priorities"},
                {SYMT_SeeAlso, "ScriptServer:RemoveHost"}) {
    args.ReturnBoolean(self.AddHost(args));
}

KORVEL_FUNCTION(ScriptServerApp, RemoveHost, 0, {SYMT_ShortHelp, "Takes a host off the list."},
                {SYMT_Usage, "Takes off the oldest host of a process."},
                {SYMT_ReturnType, "boolean"}, {SYMT_ReturnName, "done"}, {SYMT_ArgType, "number"},
                {SYMT_ArgName, "processID"}, {SYMT_SeeAlso, "ScriptServer:AddHost"}) {
    args.ReturnBoolean(self.RemoveHost(args[1]));
}

KORVEL_FUNCTION(ScriptServerApp, FindHost, 0, {SYMT_ShortHelp, "Finds a host by its name."},
                {SYMT_Usage,
                 "What a connected host has told of itself: the oldest one of the name, or the one "
                 "with the highest number under the key in its table Priorities."},
                {SYMT_ReturnType, "table"}, {SYMT_ReturnName, "info"}, {SYMT_ArgType, "string"},
                {SYMT_ArgName, "name"}, {SYMT_Optional, true}, {SYMT_ArgType, "string"},
                {SYMT_ArgName, "uuid"}, {SYMT_ArgType, "string"}, {SYMT_ArgName, "priorityKey"}) {
    const char* name = args[1].ToString();
    args.Return(name ? self.m_Hosts.Find(name, args[2], args[3]) : ScriptVal());
}

KORVEL_FUNCTION(ScriptServerApp, GetHostList, 0,
                {SYMT_ShortHelp, "Lists what connected hosts have told of themselves."}) {
    g_ScriptServerLog.PrintF("GetHostList\n");
    args.Return(self.m_Hosts.ListInfos());
}

KORVEL_FUNCTION(
    ScriptServerApp, StartHost, 0, {SYMT_ShortHelp, "Starts a host."},
    {SYMT_Usage,
     "Runs a command on this machine unless such a host is connected. The caller has to be on "
     "this machine, too, unless KORVEL_AllowRemoteStart is set for the server."},
    {SYMT_ReturnType, "boolean"}, {SYMT_ReturnName, "done"}, {SYMT_ReturnType, "number"},
    {SYMT_ReturnName, "processID"}, {SYMT_ArgType, "string"}, {SYMT_ArgName, "name"},
    {SYMT_ArgType, "string"}, {SYMT_ArgName, "command"}, {SYMT_Optional, true},
    {SYMT_ArgType, "boolean"}, {SYMT_ArgName, "force"},
    {SYMT_ArgDesc, "true to run it in any case"}) {
    const char* name = args[1].ToString();
    const char* command = args[2].ToString();
    uint64_t processID = 0;
    bool isStarted = name && command &&
                     self.StartHost(args.GetApp(), name, command, args[3].ToBoolean(), processID);
    args.ReturnBoolean(isStarted);
    if (isStarted) args.ReturnNumber(static_cast<double>(processID));
}

KORVEL_FUNCTION(ScriptServerApp, NotifyHosts, 0, {SYMT_ShortHelp, "Calls a member of all hosts."},
                {SYMT_Usage, "Calls it with one value, and does not wait."},
                {SYMT_ArgType, "string"}, {SYMT_ArgName, "member"}, {SYMT_ArgType, "any"},
                {SYMT_ArgName, "value"}, {SYMT_Optional, true}, {SYMT_ArgType, "boolean"},
                {SYMT_ArgName, "includeCaller"}, {SYMT_ArgDesc, "true when it is not given"}) {
    const char* name = args[1].ToString();
    if (name) self.NotifyHosts(name, args[2], args[3].ToBoolean(true) ? nullptr : args.GetApp());
}

KORVEL_FUNCTION(ScriptServerApp, Connect, 0, {SYMT_ShortHelp, "Does nothing."}) {}

// A reply that never comes, for those who test their time-outs.
KORVEL_FUNCTION(ScriptServerApp, PktTest, SSF_Hidden, {SYMT_ShortHelp, "Answers or does not."}) {
    bool mustReply = args[1].ToBoolean();
    std::unique_ptr<ScriptArgs> later(args.DeferReply());
    if (later && mustReply) later->SendReply();
}

KORVEL_PUBLISHED(ScriptServerApp);

}  // namespace Korvel

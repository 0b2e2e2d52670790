#include "remote/ScriptPort.h"

#include <unistd.h>

#include <algorithm>

#include "Platform/Threads.h"
#include "diag/Debug.h"
#include "objects/ScriptConfig.h"
#include "objects/ScriptObject.h"
#include "remote/RegistrationInternal.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPortInternal.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

// That connections have to end. One whose peer does not close needs a second by itself.
constexpr int64_t kEndWaitNs = 2000 * kNsPerMs;

constinit std::atomic<int> g_WaitingForUI{0};

// Where nobody can call a host yet: the members are there before the first peer is accepted.
bool StartHost(ScriptConfig& config) {
    unsigned int port;
    if (!OpenListener(port)) return false;
    g_HostInfo["Port"] = port;
    ScriptObject* app = config.GetApp ? config.GetApp(config.m_UserData, nullptr) : nullptr;
    if (ScriptInfo* info = app ? app->GetScriptInfo() : nullptr) PublishHostMembers(*info);
    config.m_Active = true;
    if (StartListener(port)) return true;
    WithdrawHostMembers();
    return false;
}

// Registering belongs to a start, and can be broken off.
enum class Phase : uint32_t { Stopped, Pending, Starting, Registering, Started };
constinit std::atomic<Phase> s_Phase{Phase::Stopped};

bool Enter(Phase from, Phase to) {
    bool isEntered = s_Phase.compare_exchange_strong(from, to);
    if (isEntered) s_Phase.notify_all();
    return isEntered;
}

// From Start to Stop, for the thread that does these; under the lock for those who end a start.
KorvelScript::Lock& s_RegistrationLock = *new KorvelScript::Lock;
ptr<Registration>& s_Registration = *new ptr<Registration>;

ptr<Registration> GetRegistration() {
    KorvelScript::AutoLock guard(s_RegistrationLock);
    return s_Registration;
}

void SetRegistration(ptr<Registration> registration) {
    KorvelScript::AutoLock guard(s_RegistrationLock);
    std::swap(s_Registration, registration);
}

// The last step of a start, on whatever thread that is.
void EndStart() {
    g_ScriptingActive = true;
    g_ScriptingActive.notify_all();
    (void)(Enter(Phase::Starting, Phase::Started) || Enter(Phase::Registering, Phase::Started));
}

void FillHostInfo(const ScriptConfig& config, const ScriptVal& hostInfo) {
    g_HostInfo = hostInfo;
    g_HostInfo.Ensure(SV_Table);
    g_HostInfo["Name"] = config.m_AppName;
    g_HostInfo["ProcessID"] = getpid();
    g_HostInfo["UUID"] = GetAppUUID();
}

// All but registering, which goes on beside it: EndStart comes when the first attempt is over.
// False when the host cannot listen.
bool DoStart(ScriptConfig& config) {
    g_StartHooks.m_LibCurlInit();
    if (!(config.m_Flags & SCF_Host)) {
        EndStart();
        return true;
    }
    if (!StartHost(config)) {
        config.m_Active = false;  // where the start was deferred
        g_StartHooks.m_LibCurlCleanup();
        Enter(Phase::Starting, Phase::Stopped);
        return false;
    }
    ptr<Registration> registration(
        new Registration(g_HostInfo, config.m_AppName != nullptr, EndStart));
    SetRegistration(registration);
    if (registration->Start()) {
        Enter(Phase::Starting, Phase::Registering);
        return true;
    }
    g_ScriptServerLog.PrintF("There is no thread that registers this host.\n");
    SetRegistration({});
    EndStart();
    return true;
}

unsigned long long RunDeferred(void* config, void*) {
    if (Enter(Phase::Pending, Phase::Starting)) DoStart(*static_cast<ScriptConfig*>(config));
    return 0;
}

}  // namespace

constinit std::atomic<bool> g_ScriptingActive{false};
constinit std::atomic<bool> g_IsTorvane{false};
constinit ScriptVal g_HostInfo;
constinit StartHooks g_StartHooks;

void _InitScripting(ScriptConfig& config, TagList*) {
    ScriptConfig* none = nullptr;
    g_ScriptConfig.compare_exchange_strong(none, &config);
    GetAppUUID();
}

void InitScripting(ScriptConfig& config, TagList* tags) {
    if (g_ScriptConfig) return;
    SetGUIThread(Platform::GetCurrentThreadID());
    _InitScripting(config, tags);
}

bool StartScripting(const ScriptVal& hostInfo, TagList*) {
    ScriptConfig* config = g_ScriptConfig;
    if (!config) return false;
    if (Enter(Phase::Stopped, Phase::Starting) || Enter(Phase::Pending, Phase::Starting)) {
        FillHostInfo(*config, hostInfo);
        if (!DoStart(*config)) return false;
    }
    s_Phase.wait(Phase::Starting);
    s_Phase.wait(Phase::Registering);
    return g_ScriptingActive;
}

void DeferStartScripting(const ScriptVal& hostInfo, TagList* tags) {
    ScriptConfig* config = g_ScriptConfig;
    if (!config) return;
    if (!(config->m_Flags & SCF_Host) || !config->UIExecute) {
        StartScripting(hostInfo, tags);
        return;
    }
    if (!Enter(Phase::Stopped, Phase::Pending)) return;
    FillHostInfo(*config, hostInfo);
    config->m_Active = true;
    config->UIExecute(RunDeferred, config, nullptr, false);
}

void StopScripting(TagList*) {
    ScriptConfig* config = g_ScriptConfig;
    if (!config) return;
    if (Enter(Phase::Pending, Phase::Stopped)) {
        config->m_Active = false;
        return;
    }
    s_Phase.wait(Phase::Starting);
    ptr<Registration> registration = GetRegistration();
    if (s_Phase == Phase::Registering && registration) registration->Stop();
    s_Phase.wait(Phase::Registering);
    if (!g_ScriptingActive.exchange(false)) return;
    if (registration) {
        LeaveServer();
        if (!registration->Stop()) {
            g_ScriptServerLog.PrintF("The thread that registers this host does not end.\n");
        }
        SetRegistration({});
    }
    if (config->m_Active.exchange(false)) {
        CloseListener();
        WithdrawHostMembers();
    }
    ReapChildren();
    g_StartHooks.m_LibCurlCleanup();
    s_Phase = Phase::Stopped;
}

void CleanupScripting(TagList* tags) {
    StopScripting(tags);
    // First all are told, so that they end at the same time.
    auto end = [](void*, RemoteApp& app) {
        app.CancelConnect();
        app._Disconnect(0);
    };
    ForEachApp(end, nullptr);
    int64_t deadlineNs = NowNs() + kEndWaitNs;
    auto await = [](void* deadline, RemoteApp& app) {
        int64_t left = *static_cast<int64_t*>(deadline) - NowNs();
        app._Disconnect(static_cast<unsigned int>(std::max<int64_t>(left, 0) / kNsPerMs));
    };
    ForEachApp(await, &deadlineNs);
    AwaitConnecting(deadlineNs);
}

void SetWaitingForUI(bool isWaiting) {
    g_WaitingForUI += isWaiting ? 1 : -1;
}

bool IsWaitingForUI() {
    return g_WaitingForUI > 0;
}

bool IsListenPortActive() {
    return false;
}
void _RemoveScriptObject(void*, TagList*) {}

const ScriptVal& GetAppUUID() {
    static const ScriptVal& uuid = *new ScriptVal(ScriptVal::CreateUUID());
    return uuid;
}

}  // namespace Korvel

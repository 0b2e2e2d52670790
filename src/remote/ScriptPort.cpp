#include "remote/ScriptPort.h"

#include <unistd.h>

#include <algorithm>

#include "Platform/Threads.h"
#include "objects/ScriptConfig.h"
#include "objects/ScriptObject.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPortInternal.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

// That connections have to end. One whose peer does not close needs a second by itself.
constexpr int64_t kEndWaitNs = 2000 * kNsPerMs;

// Where nobody can call a host yet: the members are there before the first peer is accepted.
bool StartHost(ScriptConfig& config) {
    unsigned int port;
    if (!OpenListener(port)) return false;
    g_HostInfo["Port"] = port;
    ScriptObject* app = config.GetApp ? config.GetApp(config.m_UserData, nullptr) : nullptr;
    if (ScriptInfo* info = app ? app->GetScriptInfo() : nullptr) PublishHostMembers(*info);
    config.m_Active = true;
    if (StartListener(port)) return true;
    config.m_Active = false;
    WithdrawHostMembers();
    return false;
}

}  // namespace

constinit std::atomic<bool> g_ScriptingActive{false};
constinit std::atomic<bool> g_IsTorvane{false};
constinit ScriptVal g_HostInfo;

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
    if (g_ScriptingActive) return true;
    ScriptConfig* config = g_ScriptConfig;
    if (!config) return false;
    g_HostInfo = hostInfo;
    g_HostInfo.Ensure(SV_Table);
    g_HostInfo["Name"] = config->m_AppName;
    g_HostInfo["ProcessID"] = getpid();
    g_HostInfo["UUID"] = GetAppUUID();
    if ((config->m_Flags & SCF_Host) && !StartHost(*config)) return false;
    // TODO(remote): registers with the script server of this machine, so that others find the host
    // by its name.
    g_ScriptingActive = true;
    return true;
}

void StopScripting(TagList*) {
    if (!g_ScriptingActive.exchange(false)) return;
    ScriptConfig& config = *g_ScriptConfig;
    if (!config.m_Active) return;
    config.m_Active = false;
    CloseListener();
    WithdrawHostMembers();
}

void CleanupScripting(TagList* tags) {
    StopScripting(tags);
    // First all are told, so that they end at the same time.
    ForEachApp([](void*, RemoteApp& app) { app._Disconnect(0); }, nullptr);
    int64_t deadlineNs = NowNs() + kEndWaitNs;
    auto await = [](void* deadline, RemoteApp& app) {
        int64_t left = *static_cast<int64_t*>(deadline) - NowNs();
        app._Disconnect(static_cast<unsigned int>(std::max<int64_t>(left, 0) / kNsPerMs));
    };
    ForEachApp(await, &deadlineNs);
}

const ScriptVal& GetAppUUID() {
    static const ScriptVal& uuid = *new ScriptVal(ScriptVal::CreateUUID());
    return uuid;
}

}  // namespace Korvel

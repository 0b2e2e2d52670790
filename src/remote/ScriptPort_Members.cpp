// The members by which a peer introduces itself to a host.
#include <algorithm>
#include <utility>
#include <vector>

#include "core/ScriptValInternal.h"
#include "core/TagList.h"
#include "objects/ScriptConfig.h"
#include "objects/ScriptSymbol.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptPortInternal.h"
#include "remote/TrafficInternal.h"

namespace Korvel {

KorvelScript::Lock& g_ProcLock = *new KorvelScript::Lock;
constinit ScriptVal g_ProcIDs;

namespace {

constexpr unsigned long long TAG_Connection = TAG_PTR;  // for ScriptConfig::GetApp

// What this process has kept for one that it has started, which takes it; nil for any other. Those
// are of this machine, so an id from elsewhere means another process.
ScriptVal TakeProcessData(const ScriptVal& processID, const RemoteApp& app) {
    if (!processID.IsNumber() || processID.ToNumber() == 0) return {};
    {
        KorvelScript::AutoLock guard(g_ProcLock);
        if (!g_ProcIDs.FindKeyConst(processID).IsTable()) return {};
    }
    if (!RemoteApp::IsLocalIP(app.GetIPAddress())) return {};
    KorvelScript::AutoLock guard(g_ProcLock);
    TableEntry* chain = g_ProcIDs.TakeTable();
    TableEntry** link = &chain;
    while (*link && (*link)->m_Key != processID) link = &(*link)->m_Next;
    TableEntry* entry = *link;
    if (entry) *link = std::exchange(entry->m_Next, nullptr);
    g_ProcIDs.SetTable(chain);
    if (!entry) return {};  // another thread was first
    ScriptVal data = std::move(entry->m_Value);
    ReleaseChain(entry);
    return data;
}

bool IsWelcome(RemoteApp* app) {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    if (!config || !config->GetApp) return true;
    TagList tags;
    tags.Set(TAG_Connection, static_cast<void*>(app), true);
    return config->GetApp(config->m_UserData, &tags) != nullptr;
}

// Functions of the application's class, whichever that is: the object is not touched.
class GlobalScripting {
public:
    void _SF___Connect(ScriptArgs& args, ScriptSymbol*, bool) {
        RemoteApp* app = args.GetApp();
        if (!app) return;
        app->SetConnectionInfo(args);
        ScriptVal answer = TakeProcessData(args.FindKeyConst(3), *app);
        if (answer.IsNil() && !IsWelcome(app)) return app->Refuse(args.m_Value.m_Args.m_Run);
        answer.Ensure(SV_Table);
        answer["UUID"] = GetAppUUID();
        ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
        answer["Name"] = g_IsTorvane ? "Torvane" : config ? config->m_AppName : nullptr;
        const ScriptVal& stateData = answer.FindKeyConst("StateData");
        if (stateData.IsTable()) app->SetStateData(stateData);
        args.Return(answer);
    }

    // TODO(remote): asks the host. It lets everybody in so far.
    void _SF___Login(ScriptArgs& args, ScriptSymbol*, bool) { args.ReturnBoolean(true); }
};

constinit ScriptSymbol* g_LoginSym = nullptr;
constinit ScriptSymbol* g_ConnectSym = nullptr;

// A symbol that has been withdrawn. What calls it by its function value holds it; a look-up by name
// takes no lock, and may stand on it a moment longer.
struct Withdrawn {
    ScriptSymbol* m_Symbol;
    int64_t m_TimeNs;
};
constexpr int64_t kMomentNs = 10000 * kNsPerMs;

std::vector<Withdrawn>& s_Withdrawn = *new std::vector<Withdrawn>;

void DeleteWithdrawn() {
    int64_t now = NowNs();
    std::erase_if(s_Withdrawn, [now](const Withdrawn& withdrawn) {
        if (now - withdrawn.m_TimeNs < kMomentNs || !withdrawn.m_Symbol->Withdraw()) return false;
        delete withdrawn.m_Symbol;
        return true;
    });
}

ScriptSymbol* Publish(ScriptInfo& info, const char* name,
                      ScriptSymbolT<GlobalScripting>::Function function) {
    return new ScriptSymbolT<GlobalScripting>(function, name, SST_Function | SSF_Hidden, info);
}

}  // namespace

void PublishHostMembers(ScriptInfo& info) {
    DeleteWithdrawn();
    g_LoginSym = Publish(info, "__Login", &GlobalScripting::_SF___Login);
    g_ConnectSym = Publish(info, "__Connect", &GlobalScripting::_SF___Connect);
}

void WithdrawHostMembers() {
    DeleteWithdrawn();
    for (ScriptSymbol** symbol : {&g_LoginSym, &g_ConnectSym}) {
        if (!*symbol) continue;
        (*symbol)->Withdraw();
        s_Withdrawn.push_back({std::exchange(*symbol, nullptr), NowNs()});
    }
}

}  // namespace Korvel

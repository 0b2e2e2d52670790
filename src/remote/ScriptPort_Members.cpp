// The members by which a peer introduces itself to a host, and logs in.
#include <algorithm>
#include <atomic>
#include <cstring>
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
    if (!app.IsPeerLocal()) return {};
    KorvelScript::AutoLock guard(g_ProcLock);
    return TakeProcessDataLocked(processID);  // nil when another thread was first
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

    void _SF___Login(ScriptArgs& args, ScriptSymbol*, bool) {
        RemoteApp* app = args.GetApp();
        ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
        if (!app || app->IsLoggedIn() || !config || !config->WantsLogin()) {
            return args.ReturnBoolean(true);
        }
        bool isGood = config->Login(config->m_UserData, app, args[1].ToString(""),
                                    args[2].ToString(""), nullptr);
        if (isGood) app->SetLoggedIn(args.m_Value.m_Args.m_Run);
        args.ReturnBoolean(isGood);
    }
};

constexpr char kLoginName[] = "__Login";
constexpr char kConnectName[] = "__Connect";

// Read by any thread, as addresses alone.
constinit std::atomic<ScriptSymbol*> g_LoginSym{nullptr};
constinit std::atomic<ScriptSymbol*> g_ConnectSym{nullptr};

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
    g_LoginSym = Publish(info, kLoginName, &GlobalScripting::_SF___Login);
    g_ConnectSym = Publish(info, kConnectName, &GlobalScripting::_SF___Connect);
}

void WithdrawHostMembers() {
    DeleteWithdrawn();
    for (std::atomic<ScriptSymbol*>* place : {&g_LoginSym, &g_ConnectSym}) {
        ScriptSymbol* symbol = place->exchange(nullptr);
        if (!symbol) continue;
        symbol->Withdraw();
        s_Withdrawn.push_back({symbol, NowNs()});
    }
}

bool IsHostMember(const char* name) {
    return strcmp(name, kLoginName) == 0 || strcmp(name, kConnectName) == 0;
}

bool IsHostMember(uint64_t function) {
    return function && (function == reinterpret_cast<uintptr_t>(g_LoginSym.load()) ||
                        function == reinterpret_cast<uintptr_t>(g_ConnectSym.load()));
}

}  // namespace Korvel

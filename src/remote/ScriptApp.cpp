#include "remote/ScriptApp.h"

#include <cstring>
#include <memory>
#include <vector>

#include "Platform/Networking.h"
#include "core/RefObject.h"
#include "diag/Env.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptPort.h"

namespace Korvel {
namespace {

EnvBool s_ConnectLock("KORVEL_ConnectLock", true, true);
EnvBool s_EarlyConnectLock("KORVEL_EarlyConnectLock", true, true);

constexpr double kLoginTimeOut = 5;  // in seconds

}  // namespace

// Never destroyed: connections may be let go of by static objects of hosts.
KorvelScript::Lock& g_AppLock = *new KorvelScript::Lock;
KorvelScript::Lock& g_ConnectLock = *new KorvelScript::Lock;
constinit RemoteApp* g_AppList = nullptr;

void RemoteApp::Enlist() {
    KorvelScript::AutoLock guard(g_AppLock);
    if (m_Link) return;
    m_Next = g_AppList;
    m_Link = &g_AppList;
    if (m_Next) m_Next->m_Link = &m_Next;
    g_AppList = this;
}

void RemoteApp::Delist() {
    KorvelScript::AutoLock guard(g_AppLock);
    if (!m_Link) return;
    *m_Link = m_Next;
    if (m_Next) m_Next->m_Link = m_Link;
}

// One more use, unless the last one has gone and the connection is about to be destroyed.
bool RemoteApp::UseIfHeld() const {
    uint32_t count = m_UseCount;
    while (count && !m_UseCount.compare_exchange_weak(count, count + 1)) continue;
    return count != 0;
}

void ForEachApp(void (*visit)(void* data, RemoteApp& app), void* data) {
    std::vector<ptr<RemoteApp>> held;
    {
        KorvelScript::AutoLock guard(g_AppLock);
        for (RemoteApp* app = g_AppList; app; app = app->m_Next) {
            if (app->UseIfHeld()) held.emplace_back(app);
        }
    }
    for (const ptr<RemoteApp>& app : held) visit(data, *app);
}

ptr<RemoteApp> RemoteApp::NewByName(const char* name, const char* subtype, const ScriptVal& uuid,
                                    const char* host, double timeOut) {
    ptr<RemoteApp> app(new RemoteApp("", 0, nullptr));
    app->SetPeer(name, host, 0, uuid.IsString() ? uuid : ScriptVal(), subtype);
    app->SetTimeOut(timeOut);
    app->Enlist();
    return app;
}

ScriptVal ScriptApp(const char* name, const char* subtype, ScriptVal uuid, const char* host,
                    double timeOut) {
    bool mustWait = name && *name != '!';
    if (name && !mustWait) name++;
    bool isTorvane = name && strcmp(name, "Torvane") == 0;
    if (isTorvane) {
        name = "Korvel";
        subtype = "Torvane";
    }
    if (mustWait) g_ScriptingActive.wait(false);
    std::unique_ptr<KorvelScript::AutoLock> turn;
    if (s_ConnectLock) turn = std::make_unique<KorvelScript::AutoLock>(g_ConnectLock);
    ptr<RemoteApp> app = RemoteApp::NewByName(name, subtype, uuid, host, timeOut);
    if (s_EarlyConnectLock) turn.reset();
    ScriptVal root = app->GetRoot();
    if (!app->Connect()) return {};
    return isTorvane ? root.CallMember("GetTorvane") : root;
}

ScriptVal AsyncScriptApp(const char* name, const char* subtype, ScriptVal uuid, const char* host,
                         double timeOut, bool connect) {
    ptr<RemoteApp> app = RemoteApp::NewByName(name, subtype, uuid, host, timeOut);
    ScriptVal root = app->GetRoot();
    if (connect) app->AsyncConnect();
    return root;
}

bool ScriptLogin(const char* host, const char* name, const char* user, const char* password) {
    ScriptVal root = ScriptApp(name, nullptr, ScriptVal(), host, kLoginTimeOut);
    return root.CallMember("__Login", user, password).ToBoolean();
}

ScriptVal ScriptApp(unsigned int ip, unsigned int port, ScriptVal& reply) {
    return ScriptApp(ip, port, reply, 0);
}

ScriptVal ScriptApp(unsigned int ip, unsigned int port, ScriptVal& reply, double timeOut) {
    char hostName[16];
    RemoteApp::StrFromIP(ip, hostName, sizeof(hostName));
    ptr<RemoteApp> app(new RemoteApp("???", ip, nullptr));
    app->SetPeer("???", hostName, ip, ScriptVal());
    app->SetTimeOut(timeOut);
    {
        KorvelScript::AutoLock turn(g_ConnectLock);
        app->Enlist();
    }
    ScriptVal root = app->GetRoot();
    return app->Connect(ip, port, reply) ? root : ScriptVal();
}

ScriptVal ScriptApp(Platform::_Socket* socket, const char* name, ScriptVal uuid) {
    ptr<RemoteApp> app(new RemoteApp("", 0, nullptr));
    return ScriptApp(app.Get(), socket, name, uuid);
}

ScriptVal ScriptApp(RemoteApp* app, Platform::_Socket* socket, const char* name, ScriptVal uuid) {
    unsigned int ip = Platform::GetSocketPeerIP(socket, nullptr);
    char hostName[16];
    RemoteApp::StrFromIP(ip, hostName, sizeof(hostName));
    app->SetPeer(name ? name : "unknown", hostName, ip, uuid);
    app->Enlist();
    ScriptVal root = app->GetRoot();
    if (!ip) {  // not connected, or no socket
        Platform::DeleteSocket(socket);
        return {};
    }
    if (!app->Connect(socket)) return {};
    app->ReportConnect();
    return root;
}

}  // namespace Korvel

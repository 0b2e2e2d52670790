#include "diag/Debug.h"
#include "remote/HostAppInternal.h"
#include "remote/ScriptApp.h"

namespace Korvel {
namespace {

// For asynchronous calls; nobody waits for a host here.
constexpr double kTimeOutSeconds = 30;

// On the main loop, which takes over the use of a connection that has ended.
unsigned long long CleanupHostApp(void* appPointer, void* server) {
    ptr<HostApp> app(static_cast<HostApp*>(appPointer));
    static_cast<ScriptServerApp*>(server)->Forget(*app);
    app->SetRoot(ScriptVal());
    return 0;
}

}  // namespace

HostApp::HostApp(ScriptServerApp& server)
    : ConnectApp("", 0),
      m_Server(server),
      m_End(new ExecNode(CleanupHostApp, this, &server, nullptr)) {
    g_ScriptServerLog.PrintF("HostApp create\n");
    SetTimeOut(kTimeOutSeconds);
}

HostApp::~HostApp() {
    g_ScriptServerLog.PrintF("HostApp destroy\n");
}

bool HostApp::Start(Platform::_Socket* socket) {
    if (!m_End) {
        Platform::DeleteSocket(socket);
        return false;
    }
    SetRoot(GetRoot());
    if (!ScriptApp(this, socket, nullptr, ScriptVal()).IsNil()) return true;
    SetRoot(ScriptVal());
    return false;
}

void HostApp::AppThreadFunc() {
    g_ScriptServerLog.PrintF("HostApp::AppThreadFunc()\n");
    Use();  // the main loop's
    ConnectApp::AppThreadFunc();
    if (!m_Server.Put(m_End)) Recycle();
}

}  // namespace Korvel

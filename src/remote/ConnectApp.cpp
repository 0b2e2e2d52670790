#include "remote/ConnectApp.h"

#include <utility>

#include "remote/TrafficInternal.h"

namespace Korvel {

ConnectApp::~ConnectApp() = default;

ConnectApp* ConnectApp::New() {
    auto* app = new ConnectApp("unknown", 0);
    app->SetRoot(app->GetRoot());
    return app;
}

void ConnectApp::AppThreadFunc() {
    Use();
    AcceptedApp::AppThreadFunc();
    SetRoot(ScriptVal());
    Recycle();
}

void ConnectApp::OnZeroLocalCount() {
    SetRoot(ScriptVal());
    RemoteApp::OnZeroLocalCount();
}

void ConnectApp::OnZeroRemoteCount() {
    RemoteApp::OnZeroRemoteCount();
}

void ConnectApp::SetRoot(const ScriptVal& root) {
    ScriptVal replaced = root;  // goes when the lock has been let go of
    {
        AutoAppLock guard(GetLock());
        std::swap(m_Root, replaced);
    }
}

}  // namespace Korvel

#pragma once

#include "remote/AcceptedApp.h"

namespace Korvel {

// A connection that somebody else has asked for. It keeps the peer's application object for as long
// as it runs, or until the peer holds nothing of this process any more: so it needs no owner, and
// closes by itself when it serves nobody.
class KORVEL_EXPORT ConnectApp : public AcceptedApp {
public:
    ConnectApp(const char* name, unsigned int ip) : AcceptedApp(name, ip) {}
    ~ConnectApp() override;

    // One that has its root, to be connected; the caller's, who calls SetRoot(nil) when that fails.
    // The other way round, a peer that leaves at once would leave it its root.
    static ConnectApp* New();

    void AppThreadFunc() override;
    void OnZeroLocalCount() override;
    void OnZeroRemoteCount() override;

    void SetRoot(const ScriptVal& root);  // the peer's application object

private:
    ScriptVal m_Root;  // guarded by the connection's lock
};

}  // namespace Korvel

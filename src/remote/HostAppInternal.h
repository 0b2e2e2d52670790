#pragma once

#include <memory>

#include "remote/ConnectApp.h"
#include "remote/ScriptServerInternal.h"

namespace Korvel {

// The script server's side of a connection. When it has ended, the main loop forgets its hosts.
class HostApp : public ConnectApp {
public:
    explicit HostApp(ScriptServerApp& server);
    ~HostApp() override;

    // Takes over a socket. False when it could not: then the object is only the caller's.
    bool Start(Platform::_Socket* socket);

    void AppThreadFunc() override;

private:
    ScriptServerApp& m_Server;
    std::unique_ptr<ExecNode> m_End;  // made before it is needed, so that it does not fail then
};

}  // namespace Korvel

#pragma once

#include <cstdint>

#include "Platform/MinList.h"
#include "remote/RemoteApp.h"

namespace Korvel {

// A connection that somebody else has asked for, over a socket. Whoever can open a connection can
// open thousands and say nothing: so those that have sent no packet yet are known, and the oldest
// of them make room for others.
class KORVEL_EXPORT AcceptedApp : public RemoteApp {
public:
    AcceptedApp(const char* name, unsigned int ip) : RemoteApp(name, ip, nullptr) {}
    ~AcceptedApp() override;

    using RemoteApp::Connect;
    bool Connect(Platform::_Socket* socket) override;
    void AppThreadFunc() override;
    void DispatchPacket(Packet* packet) override;

    // Where more than 64 connections are silent, ends the oldest of them that have been so for
    // KORVEL_SilentSeconds (30). Each new one does that.
    static void CloseSilent();

private:
    struct Silence : KorvelScript::MinNode {
        AcceptedApp* m_App = nullptr;
        int64_t m_SinceNs = 0;
        bool m_IsListed = false;
    };

    void EndSilence();
    void EndSilenceLocked();
    static AcceptedApp* TakeSilent();

    // Connection thread, once it runs
    bool m_HasSpoken = false;
    // Guarded by the lock of the list that it is on
    Silence m_Silence;
};

}  // namespace Korvel

#include "remote/AcceptedApp.h"

#include "core/RefObject.h"
#include "diag/Debug.h"
#include "diag/Env.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr uint32_t kMostSilent = 64;

EnvInt s_SilentSeconds("KORVEL_SilentSeconds", true, 30);

// The silent connections, the oldest first. Never destroyed, as connections may outlive the host.
struct SilentList : KorvelScript::MinList {
    KorvelScript::Lock m_Lock;
    uint32_t m_Count = 0;
};
SilentList& s_Silent = *new SilentList;

}  // namespace

AcceptedApp::~AcceptedApp() {
    EndSilence();
}

bool AcceptedApp::Connect(Platform::_Socket* socket) {
    EndSilence();
    {
        Platform::NoKill noKill;
        KorvelScript::AutoLock guard(s_Silent.m_Lock);
        m_Silence.m_App = this;
        m_Silence.m_SinceNs = NowNs();
        m_Silence.m_IsListed = true;
        s_Silent.Add(&m_Silence);
        s_Silent.m_Count++;
    }
    CloseSilent();
    if (RemoteApp::Connect(socket)) return true;
    EndSilence();
    return false;
}

void AcceptedApp::AppThreadFunc() {
    m_HasSpoken = false;
    RemoteApp::AppThreadFunc();
    EndSilence();
}

void AcceptedApp::DispatchPacket(Packet* packet) {
    if (!m_HasSpoken) {
        m_HasSpoken = true;
        EndSilence();
    }
    RemoteApp::DispatchPacket(packet);
}

void AcceptedApp::EndSilence() {
    Platform::NoKill noKill;
    KorvelScript::AutoLock guard(s_Silent.m_Lock);
    EndSilenceLocked();
}

void AcceptedApp::EndSilenceLocked() {
    if (!m_Silence.m_IsListed) return;
    m_Silence.m_IsListed = false;
    s_Silent.Remove(&m_Silence);
    s_Silent.m_Count--;
}

// The next one to end, with a use for the caller; null when there is none.
AcceptedApp* AcceptedApp::TakeSilent() {
    int64_t limitNs = NowNs() - s_SilentSeconds * 1000 * kNsPerMs;
    Platform::NoKill noKill;
    KorvelScript::AutoLock guard(s_Silent.m_Lock);
    while (s_Silent.m_Count > kMostSilent) {
        auto* oldest = static_cast<Silence*>(s_Silent.Next(nullptr));
        if (oldest->m_SinceNs > limitNs) return nullptr;
        oldest->m_App->EndSilenceLocked();
        if (oldest->m_App->UseIfHeld()) return oldest->m_App;
    }
    return nullptr;
}

void AcceptedApp::CloseSilent() {
    while (AcceptedApp* oldest = TakeSilent()) {
        g_ScriptServerLog.PrintF("Too many callers say nothing: the oldest has to go.\n");
        oldest->_Disconnect(0);
        oldest->Recycle();
    }
}

}  // namespace Korvel

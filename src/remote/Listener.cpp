#include <cerrno>
#include <utility>

#include "Platform/Time.h"
#include "diag/Debug.h"
#include "diag/Env.h"
#include "remote/AcceptedApp.h"
#include "remote/ListenerInternal.h"

namespace Korvel {
namespace {

using Platform::_Socket;
using Platform::kNoSocket;

constexpr unsigned int kPauseMs = 100;  // while nobody can be accepted

EnvString s_ListenAddress("KORVEL_ListenAddress", true, "");

void Close(_Socket*& socket) {
    if (socket != kNoSocket) Platform::DeleteSocket(std::exchange(socket, kNoSocket));
}

}  // namespace

bool GetListenAddress(unsigned int& ip) {
    OxStringT<char> address;
    s_ListenAddress.Get(address);
    ip = address.IsEmpty() ? 0 : RemoteApp::IPFromStr(address);
    if (ip || address.IsEmpty() || address == "0.0.0.0") return true;
    g_ScriptServerLog.PrintF("KORVEL_ListenAddress is no address: %s\n",
                             static_cast<const char*>(address));
    return false;
}

Listener::~Listener() {
    Close(m_Socket);
    Close(m_Spare);
}

bool Listener::Open(unsigned int port, unsigned int ip) {
    m_Socket = Platform::NewSocket(Platform::ST_TCP);
    m_Spare = Platform::NewSocket(Platform::ST_TCP);
    if (m_Socket != kNoSocket && m_Spare != kNoSocket) {
        Platform::SetSocketReuseAddress(m_Socket, true);
        Platform::SetSocketExclusiveAddress(m_Socket, true);
        if (Platform::BindSocket(m_Socket, port, ip) && Platform::ListenSocket(m_Socket, 0)) {
            Platform::SetSocketNonBlocking(m_Socket, true);  // who called may be gone
            return true;
        }
    }
    int error = errno;
    Close(m_Socket);
    Close(m_Spare);
    errno = error;
    return false;
}

void Listener::TurnAway() {
    g_ScriptServerLog.PrintF("There are no more sockets for those who call.\n");
    AcceptedApp::CloseSilent();
    Close(m_Spare);
    _Socket* caller = Platform::AcceptSocket(m_Socket);
    Close(caller);
    m_Spare = Platform::NewSocket(Platform::ST_TCP);
    if (m_Spare == kNoSocket) Platform::Wait(kPauseMs);
}

_Socket* Listener::Accept() {
    _Socket* caller = Platform::AcceptSocket(m_Socket);
    if (caller != kNoSocket) return caller;
    int error = errno;
    switch (error) {
        case EMFILE:
        case ENFILE:
            TurnAway();
            break;
        case EAGAIN:
        case ECONNABORTED:
            break;  // the caller has gone again
        default:
            Platform::Wait(kPauseMs);  // this may last
    }
    errno = error;
    return kNoSocket;
}

}  // namespace Korvel

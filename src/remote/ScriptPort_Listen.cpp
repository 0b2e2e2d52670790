// The listening socket of a host, and the thread that accepts who calls there.
#include <atomic>
#include <cerrno>
#include <cstring>
#include <memory>
#include <utility>

#include "Platform/Events.h"
#include "Platform/NetworkingInternal.h"
#include "Platform/Threads.h"
#include "Platform/Time.h"
#include "core/RefObject.h"
#include "diag/Debug.h"
#include "diag/Env.h"
#include "remote/ConnectApp.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptPortInternal.h"

namespace Korvel {
namespace {

using Platform::_Socket;
using Platform::kNoSocket;

constexpr unsigned int kFirstPort = 49152;
constexpr unsigned int kEndWaitMs = 10000;  // that the thread has to end
constexpr unsigned int kPauseMs = 100;      // while nobody can be accepted

EnvString s_ListenAddress("KORVEL_ListenAddress", true, "");

// What the thread works with. The thread has it alone, but for the wake-up; the host's thread takes
// it back when the other one has ended.
struct Listener {
    ~Listener() {
        Platform::DeleteSocketSet(m_Set);
        for (_Socket* socket : {m_Socket, m_Spare}) {
            if (socket != kNoSocket) Platform::DeleteSocket(socket);
        }
    }

    _Socket* m_Socket = kNoSocket;
    // Kept for the time when there are no more descriptors: given up, it lets a caller in, to be
    // turned away. One that is left in the queue of the socket wakes the thread for ever.
    _Socket* m_Spare = kNoSocket;
    Platform::_SocketSet* m_Set = nullptr;
    int m_SocketID = 0;
    int m_QuitID = 0;
};

// Of the host's thread
constinit std::unique_ptr<Listener> s_Listener;
constinit Platform::_Thread* s_ListenThread = nullptr;

constinit std::atomic<unsigned int> s_Port{0};

// A mistake must not open the host to everybody.
bool GetListenAddress(unsigned int& ip) {
    OxStringT<char> address;
    s_ListenAddress.Get(address);
    ip = address.IsEmpty() ? 0 : RemoteApp::IPFromStr(address);
    if (ip || address.IsEmpty() || address == "0.0.0.0") return true;
    g_ScriptServerLog.PrintF("KORVEL_ListenAddress is no address: %s\n",
                             static_cast<const char*>(address));
    return false;
}

void TurnAway(Listener& listener) {
    g_ScriptServerLog.PrintF("There are no more sockets for those who call.\n");
    Platform::DeleteSocket(std::exchange(listener.m_Spare, kNoSocket));
    Platform::DeleteSocket(Platform::AcceptSocket(listener.m_Socket));
    listener.m_Spare = Platform::NewSocket(Platform::ST_TCP);
    if (listener.m_Spare == kNoSocket) Platform::Wait(kPauseMs);
}

void Accept(Listener& listener) {
    _Socket* socket = Platform::AcceptSocket(listener.m_Socket);
    if (socket != kNoSocket) {
        AcceptListen(socket);
        return;
    }
    switch (errno) {
        case EMFILE:
        case ENFILE:
            return TurnAway(listener);
        case EAGAIN:
        case ECONNABORTED:
            return;  // the caller has gone again
        default:
            Platform::Wait(kPauseMs);  // this may last
    }
}

unsigned long long Listen(void* pointer) {
    Platform::SetThreadName("ScriptPort [Listen]", nullptr);
    Listener& listener = *static_cast<Listener*>(pointer);
    while (true) {
        int found = Platform::WaitSocketSet(listener.m_Set, Platform::kNoTimeLimit);
        if (found == listener.m_QuitID) return 0;
        if (Platform::GetSocketSetEvents(listener.m_Set, listener.m_SocketID) &
            Platform::SE_ACCEPT) {
            Accept(listener);
        } else {
            Platform::Wait(kPauseMs);  // the wait has failed
        }
    }
}

}  // namespace

// Two sockets may be bound to one port as long as neither listens, so each port is tried whole.
bool OpenListener(unsigned int& port) {
    unsigned int ip;
    if (!GetListenAddress(ip)) return false;
    for (port = kFirstPort; port < kNoFreePort; port++) {
        auto listener = std::make_unique<Listener>();
        listener->m_Socket = Platform::NewSocket(Platform::ST_TCP);
        if (listener->m_Socket == kNoSocket) return false;
        Platform::SetSocketReuseAddress(listener->m_Socket, true);
        Platform::SetSocketExclusiveAddress(listener->m_Socket, true);
        if (Platform::BindSocket(listener->m_Socket, port, ip) &&
            Platform::ListenSocket(listener->m_Socket, 0)) {
            Platform::SetSocketNonBlocking(listener->m_Socket, true);  // who called may be gone
            s_Listener = std::move(listener);
            return true;
        }
        int error = errno;
        if (error == EADDRINUSE) continue;
        g_ScriptServerLog.PrintF("Cannot listen at port %u: %s\n", port, strerror(error));
        return false;
    }
    return true;
}

bool StartListener(unsigned int port) {
    if (!s_Listener) return true;
    Listener& listener = *s_Listener;
    listener.m_Spare = Platform::NewSocket(Platform::ST_TCP);
    listener.m_Set = Platform::NewSocketSet(2);
    listener.m_SocketID =
        Platform::AddSocketSet(listener.m_Set, listener.m_Socket, Platform::SE_ACCEPT);
    listener.m_QuitID = Platform::AddSocketSet(listener.m_Set, nullptr, 0);
    if (listener.m_SocketID && listener.m_QuitID) {
        s_ListenThread = Platform::NewThread(Listen, &listener, 0, nullptr);
    }
    if (!s_ListenThread) {
        CloseListener();
        return false;
    }
    s_Port = port;
    return true;
}

void CloseListener() {
    s_Port = 0;
    if (s_ListenThread) {
        Platform::SocketSetEvent(s_Listener->m_Set, s_Listener->m_QuitID);
        bool hasEnded = Platform::WaitThread(s_ListenThread, kEndWaitMs);
        Platform::DeleteThread(std::exchange(s_ListenThread, nullptr));
        if (!hasEnded) {
            g_ScriptServerLog.PrintF("The listener does not end.\n");
            (void)s_Listener.release();  // it stays the thread's
        }
    }
    s_Listener.reset();
}

unsigned int GetListenPort() {
    return s_Port;
}

ConnectApp* AcceptListen(_Socket* socket) {
    ptr<ConnectApp> app(ConnectApp::New());
    if (!ScriptApp(app.Get(), socket, nullptr, ScriptVal()).IsNil()) return app.Get();
    app->SetRoot(ScriptVal());
    return nullptr;
}

}  // namespace Korvel

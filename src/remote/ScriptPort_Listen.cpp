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
#include "remote/ConnectApp.h"
#include "remote/ListenerInternal.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptPortInternal.h"

namespace Korvel {
namespace {

using Platform::_Socket;
using Platform::kNoSocket;

constexpr unsigned int kFirstPort = 49152;
constexpr unsigned int kEndWaitMs = 10000;  // that the thread has to end
constexpr unsigned int kPauseMs = 100;      // when the wait for callers has failed

// What the thread works with. The thread has it alone, but for the wake-up; the host's thread takes
// it back when the other one has ended.
struct HostListener : Listener {
    ~HostListener() { Platform::DeleteSocketSet(m_Set); }

    Platform::_SocketSet* m_Set = nullptr;
    int m_SocketID = 0;
    int m_QuitID = 0;
};

// Of the host's thread
constinit std::unique_ptr<HostListener> s_Listener;
constinit Platform::_Thread* s_ListenThread = nullptr;

constinit std::atomic<unsigned int> s_Port{0};

unsigned long long Listen(void* pointer) {
    Platform::SetThreadName("ScriptPort [Listen]", nullptr);
    HostListener& listener = *static_cast<HostListener*>(pointer);
    while (true) {
        int found = Platform::WaitSocketSet(listener.m_Set, Platform::kNoTimeLimit);
        if (found == listener.m_QuitID) return 0;
        if (Platform::GetSocketSetEvents(listener.m_Set, listener.m_SocketID) &
            Platform::SE_ACCEPT) {
            _Socket* caller = listener.Accept();
            if (caller != kNoSocket) AcceptListen(caller);
        } else {
            Platform::Wait(kPauseMs);  // the wait has failed
        }
    }
}

}  // namespace

bool OpenListener(unsigned int& port) {
    unsigned int ip;
    if (!GetListenAddress(ip)) return false;
    for (port = kFirstPort; port < kNoFreePort; port++) {
        auto listener = std::make_unique<HostListener>();
        if (listener->Open(port, ip)) {
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
    HostListener& listener = *s_Listener;
    listener.m_Set = Platform::NewSocketSet(2);
    listener.m_SocketID =
        Platform::AddSocketSet(listener.m_Set, listener.GetSocket(), Platform::SE_ACCEPT);
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

// How a connection comes about. By address and port: with a handshake, in which the peer tells who
// it is. By name: the script server of the peer's machine is asked for the port, over a connection
// of its own, and then the peer is called. One thread at a time does that, and another one may
// cancel it.
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstring>

#include "Platform/Events.h"
#include "Platform/FutexInternal.h"
#include "Platform/NetworkingInternal.h"
#include "Platform/Threads.h"
#include "core/RefObject.h"
#include "diag/Debug.h"
#include "objects/ScriptConfig.h"
#include "remote/ConnectApp.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptServer.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr size_t kMostUUIDBytes = 127;
constexpr double kMaxWaitMs = 0x7fffffff;
constexpr double kMaxPort = 65535;
constexpr unsigned int kLeaveServerMs = 1000;  // that the end of a call at the server may take

// Threads of AsyncConnect.
constinit Platform::FutexWord s_NumConnecting{0};

bool IsSelf(Platform::_Socket* socket, unsigned int port, unsigned int ip) {
    Platform::_SocketAddress* own = Platform::GetSocketAddress(socket);
    bool isSelf =
        Platform::SocketAddressGetPort(own) == port && Platform::SocketAddressGetIP(own) == ip;
    Platform::DeleteSocketAddress(own);
    return isSelf;
}

void LogUnless(bool isGood, const char* what) {
    if (isGood) return;
    g_ScriptServerLog.PrintF("RemoteApp::Connect - %s err %d\n", what,
                             static_cast<int>(Platform::GetSocketError()));
}

// An attempt to connect, which does not block, has begun.
bool BeginCall(Platform::_Socket* socket, unsigned int port, unsigned int ip) {
    if (Platform::ConnectSocket(socket, port, ip)) return true;
    Platform::SocketError error = Platform::GetSocketError();
    if (error == Platform::SERR_NONE || error == Platform::SERR_INPROGRESS ||
        error == Platform::SERR_WOULDBLOCK) {
        return true;
    }
    g_ScriptServerLog.PrintF("RemoteApp::Connect - connect err %d\n", error);
    return false;
}

// What a peer or a server claims may be anything.
bool IsUUIDText(const ScriptVal& uuid) {
    const char* text = uuid.ToString("");
    return *text && strnlen(text, kMostUUIDBytes + 1) <= kMostUUIDBytes;
}

bool IsLocalOnly() {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    return config && (config->m_Flags & SCF_LocalOnly);
}

}  // namespace

bool AwaitConnecting(int64_t deadlineNs) {
    constexpr int64_t kSecond = 1000000000;
    timespec deadline = {deadlineNs / kSecond, deadlineNs % kSecond};
    while (uint32_t count = s_NumConnecting) {
        if (Platform::FutexWaitSteady(s_NumConnecting, count, &deadline) == ETIMEDOUT) return false;
    }
    return true;
}

// Taking turns

// Holds the turn to connect a connection, if the thread can have it.
class RemoteApp::ConnectTurn {
public:
    explicit ConnectTurn(RemoteApp& app) : m_App(app.BeginConnecting() ? &app : nullptr) {}
    ConnectTurn(const ConnectTurn&) = delete;
    ConnectTurn& operator=(const ConnectTurn&) = delete;
    ~ConnectTurn() {
        if (m_App) m_App->EndConnecting();
    }
    explicit operator bool() const { return m_App != nullptr; }

private:
    RemoteApp* const m_App;
};

bool RemoteApp::BeginConnecting() {
    const char* refusal = nullptr;
    {
        AutoAppLock guard(m_Lock);
        if (IsConnectionThread()) {
            refusal = "A connection's own thread cannot connect it.";
        } else if (m_Traffic->m_IsConnecting) {
            refusal = "Another thread connects it.";
        } else {
            m_Traffic->m_IsConnecting = true;
            m_Traffic->m_IsCancelled = false;
        }
    }
    if (refusal) g_ScriptServerLog.PrintF("%s\n", refusal);
    return !refusal;
}

void RemoteApp::EndConnecting() {
    AutoAppLock guard(m_Lock);
    m_Traffic->m_IsConnecting = m_Traffic->m_IsCancelled = false;
}

void RemoteApp::CancelConnect() {
    ptr<RemoteApp> server;
    {
        AutoAppLock guard(m_Lock);
        Traffic& traffic = *m_Traffic;
        if (!traffic.m_IsConnecting) return;
        traffic.m_IsCancelled = true;
        if (traffic.m_CallSet) Platform::SocketSetEvent(traffic.m_CallSet, traffic.m_CancelEvent);
        server = ptr<RemoteApp>::Share(traffic.m_Server);
    }
    if (!server) return;
    server->CancelConnect();
    server->_Disconnect(0);
}

// By name

bool RemoteApp::Connect(ScriptVal& reply) {
    reply = SV_Nil;
    ConnectTurn turn(*this);
    return turn && ConnectByName(reply);
}

bool RemoteApp::Connect() {
    ScriptVal reply;
    return Connect(reply);
}

bool RemoteApp::AsyncConnect() {
    auto connect = [](void* pointer) -> unsigned long long {
        auto* app = static_cast<RemoteApp*>(pointer);
        Platform::SetThreadName("RemoteApp [Connect]", nullptr);
        bool isConnected;
        {
            ScriptVal reply;
            isConnected = app->ConnectByName(reply);
        }
        app->EndConnecting();
        app->EndAsyncConnect(isConnected);
        return 0;
    };
    if (!BeginConnecting()) return false;
    Enlist();  // where it is found to be cancelled
    Use();
    s_NumConnecting++;
    Platform::_Thread* thread = Platform::NewThread(connect, this, 0, nullptr);
    if (thread) {
        Platform::DeleteThread(thread);
        return true;
    }
    EndConnecting();
    EndAsyncConnect(true);  // nothing has failed that the caller does not know of
    return false;
}

// Gives back what the thread holds.
void RemoteApp::EndAsyncConnect(bool isConnected) {
    if (!isConnected) RunOnUI(TellConnectFailed);
    Recycle();
    s_NumConnecting--;
    Platform::FutexWake(&s_NumConnecting, INT_MAX);
}

bool RemoteApp::ConnectByName(ScriptVal& reply) {
    g_ScriptServerLog.PrintF("RemoteApp::Connect to %s\n", static_cast<const char*>(GetHostName()));
    _Disconnect(Platform::kNoTimeLimit);
    ScriptVal uuid = GetUUID();
    uint16_t run = GetRun();
    unsigned int ip = IPFromStr(GetHostName());
    if (ip && ConnectByName(ip, reply)) return true;
    {
        AutoAppLock guard(m_Lock);
        m_UUID = uuid;  // what the server has told was of no use
    }
    Cleanup(run);
    return false;
}

bool RemoteApp::ConnectByName(unsigned int ip, ScriptVal& reply) {
    {
        AutoAppLock guard(m_Lock);
        m_IP = ip;
    }
    unsigned int ownPort = IsUUID(GetAppUUID()) ? GetListenPort() : 0;
    if (ownPort && IsLocalIP(ip) && ConnectByAddress(ip, ownPort, reply)) return true;
    if (GetName().IsEmpty()) return ConnectToServer(ip);  // which itself is wanted
    ScriptVal info;
    if (!FindHost(ip, info)) return false;
    double port = info.FindKeyConst("Port").ToNumber(0);
    if (!(port >= 1 && port <= kMaxPort)) return false;
    const ScriptVal& uuid = info.FindKeyConst("UUID");
    if (IsUUIDText(uuid)) {
        AutoAppLock guard(m_Lock);
        m_UUID = uuid;
    }
    return ConnectByAddress(ip, static_cast<unsigned int>(port), reply);
}

bool RemoteApp::ConnectToServer(unsigned int ip) {
    bool isAllowed = !IsLocalOnly() || IsLocalIP(ip);
    if (isAllowed && ConnectThere(ip, g_ScriptServerPort, PeerKind::Server)) return true;
    g_ScriptServerLog.PrintF("RemoteApp::Connect - can not create socket %d\n",
                             static_cast<int>(Platform::GetSocketError()));
    return false;
}

// What the script server tells of the host. It is asked over a connection of its own: who uses this
// one meanwhile must not reach the server. False also when that does not end.
bool RemoteApp::FindHost(unsigned int ip, ScriptVal& info) {
    ptr<RemoteApp> server = NewByName("", nullptr, ScriptVal(), GetHostName(), GetTimeOut());
    ScriptVal root = server->GetRoot();
    ConnectTurn turn(*server);
    {
        AutoAppLock guard(m_Lock);
        if (m_Traffic->m_IsCancelled) return false;
        m_Traffic->m_Server = server.Get();
    }
    bool isThere = server->ConnectToServer(ip);
    if (isThere) info = AskServer(root);
    bool hasEnded = isThere && server->_Disconnect(kLeaveServerMs);
    AutoAppLock guard(m_Lock);
    m_Traffic->m_Server = nullptr;
    return hasEnded;
}

ScriptVal RemoteApp::AskServer(ScriptVal& root) {
    OxStringT<char> name, subtype;
    ScriptVal uuid;
    {
        AutoAppLock guard(m_Lock);
        name = m_Name;
        subtype = m_Subtype;
        uuid = m_UUID;
    }
    const char* text = name;
    if (subtype.IsEmpty()) return root.CallMember("FindHost", text, uuid);
    return root.CallMember("FindHost", text, uuid, static_cast<const char*>(subtype));
}

// By address and port

ScriptVal RemoteApp::GetRoot() {
    RemoteObject* proxy = IncRemoteRef(kRootID);
    if (!proxy) return {};
    ScriptVal root;
    root.Set(SV_RemoteObject, &proxy);
    DecProxy(proxy);  // the value has a count of its own
    return root;
}

bool RemoteApp::Connect(unsigned int ip, unsigned int port, ScriptVal& reply) {
    reply = SV_Nil;
    ConnectTurn turn(*this);
    return turn && ConnectByAddress(ip, port, reply);
}

bool RemoteApp::ConnectByAddress(unsigned int ip, unsigned int port, ScriptVal& reply) {
    _Disconnect(Platform::kNoTimeLimit);
    {
        AutoAppLock guard(m_Lock);
        m_IP = ip;
    }
    ScriptVal root = GetRoot();
    uint16_t run = GetRun();
    bool isOwn = port && port == GetListenPort() && IsLocalIP(ip);
    if (isOwn ? ConnectHere() : ConnectThere(ip, port, PeerKind::Host)) {
        if (ShakeHands(root, reply)) return true;
        Close("the peer has not told who it is, or is not the one who was there before");
        _Disconnect(Platform::kNoTimeLimit);
    }
    Cleanup(run);
    return false;
}

bool RemoteApp::ConnectThere(unsigned int ip, unsigned int port, PeerKind kind) {
    Platform::_Socket* socket = DoConnectSock(port, ip, GetTimeOut());
    return socket != Platform::kNoSocket && ConnectOver(socket, kind);
}

Platform::_Socket* RemoteApp::DoConnectSock(unsigned int port, unsigned int ip, double timeOut) {
    Platform::_Socket* socket = Platform::NewSocket(Platform::ST_TCP);
    if (socket == Platform::kNoSocket) return socket;
    LogUnless(Platform::SetSocketLinger(socket, false, 10), "setsockopt(SO_LINGER)");
    LogUnless(Platform::SetSocketNonBlocking(socket, true), "ioctlsocket(nonblock)");
    if (timeOut > 0) g_ScriptServerLog.PrintF("RemoteApp::Connect - timeout %f\n", timeOut);
    if (BeginCall(socket, port, ip)) {
        g_ScriptServerLog.PrintF("RemoteApp::Connect - connect OK\n");
        if (AwaitAnswer(socket, timeOut) && !IsSelf(socket, port, ip)) return socket;
    }
    Platform::DeleteSocket(socket);
    return Platform::kNoSocket;
}

// Waits until an attempt has come to an end. True when the socket is connected: a refused attempt
// leaves no peer. A port of this machine at which nobody listens may become this end's own, and
// connect with itself, which the caller has to see.
bool RemoteApp::AwaitAnswer(Platform::_Socket* socket, double timeOut) {
    unsigned int waitMs = Platform::kNoTimeLimit;
    if (timeOut > 0) waitMs = static_cast<unsigned int>(std::min(timeOut * 1000, kMaxWaitMs));
    Traffic& traffic = *m_Traffic;
    Platform::_SocketSet* set = Platform::NewSocketSet(1);
    int entry = Platform::AddSocketSet(set, socket, Platform::SE_CONNECT | Platform::SE_CLOSE);
    {
        AutoAppLock guard(m_Lock);
        traffic.m_CancelEvent = Platform::AddSocketSet(set, nullptr, 0);
        traffic.m_CallSet = set;
        if (traffic.m_IsCancelled) Platform::SocketSetEvent(set, traffic.m_CancelEvent);
    }
    int found = Platform::WaitSocketSet(set, waitMs);
    LogUnless(found >= 0, "select");
    if (found == 0) g_ScriptServerLog.PrintF("RemoteApp::Connect - select timeout\n");
    {
        AutoAppLock guard(m_Lock);
        traffic.m_CallSet = nullptr;
    }
    Platform::DeleteSocketSet(set);
    return found > 0 && found == entry && Platform::GetSocketPeerIP(socket, nullptr);
}

// The peer is this process: the two ends take packets from each other.
bool RemoteApp::ConnectHere() {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    if (IsGUIThread() && config && config->m_Active && config->UIExecute) {
        g_ScriptServerLog.PrintF("The UI thread cannot wait for what it has to do itself.\n");
        return false;
    }
    ptr<ConnectApp> accepted(ConnectApp::New());
    accepted->SetPeer("unknown", "127.0.0.1", IPFromStr("127.0.0.1"), ScriptVal());
    accepted->Enlist();
    if (Join(this, accepted.Get())) {
        accepted->ReportConnect();
        return true;
    }
    accepted->SetRoot(ScriptVal());
    return false;
}

// Each end tells the other who it is. The peer's answer is hostile until it has been looked at.
bool RemoteApp::ShakeHands(ScriptVal& root, ScriptVal& reply) {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    ScriptVal ownName(config ? config->m_AppName : nullptr);
    reply = root.CallMember("__Connect", ownName, GetAppUUID(), getpid());
    const ScriptVal& uuid = reply.FindKeyConst("UUID");
    const char* name = reply.FindKeyConst("Name").ToString();
    if (!IsUUIDText(uuid)) return false;
    {
        AutoAppLock guard(m_Lock);
        if (!*m_UUID.ToString("")) m_UUID = uuid;
        if (m_UUID != uuid) return false;
        if (name) m_Name = CutName(name);
    }
    ReportConnect();
    return true;
}

void RemoteApp::Refuse(uint16_t run) {
    {
        AutoAppLock guard(m_Lock);
        if (m_Traffic->m_Run != run) return;
        m_Traffic->m_IsRefused = m_Traffic->m_WantsEnd = true;
    }
    Wake();
}

}  // namespace Korvel

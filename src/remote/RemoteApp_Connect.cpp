// How a connection comes about: by address and port, with a handshake in which the peer tells who
// it is. Connecting by name is the work of a layer above.
#include <strings.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <bit>
#include <cstdio>
#include <cstring>

#include "Platform/Events.h"
#include "Platform/NetworkingInternal.h"
#include "core/RefObject.h"
#include "diag/Debug.h"
#include "objects/ScriptConfig.h"
#include "remote/ConnectApp.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptPort.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr int kHostNameSize = 256;
constexpr size_t kMostUUIDBytes = 127;
constexpr double kMaxWaitMs = 0x7fffffff;

const unsigned int kLoopback = std::bit_cast<unsigned int>(std::array<uint8_t, 4>{127, 0, 0, 1});

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

// Waits until an attempt has come to an end. True when the socket is connected.
bool AwaitConnect(Platform::_Socket* socket, unsigned int port, unsigned int ip, double timeOut) {
    unsigned int waitMs = Platform::kNoTimeLimit;
    if (timeOut > 0) waitMs = static_cast<unsigned int>(std::min(timeOut * 1000, kMaxWaitMs));
    Platform::_SocketSet* set = Platform::NewSocketSet(1);
    Platform::AddSocketSet(set, socket, Platform::SE_CONNECT | Platform::SE_CLOSE);
    int found = Platform::WaitSocketSet(set, waitMs);
    LogUnless(found >= 0, "select");
    Platform::DeleteSocketSet(set);
    if (found == 0) g_ScriptServerLog.PrintF("RemoteApp::Connect - select timeout\n");
    // A refused attempt leaves no peer. A port of this machine at which nobody listens may become
    // this end's own, and connect with itself.
    return found > 0 && Platform::GetSocketPeerIP(socket, nullptr) && !IsSelf(socket, port, ip);
}

Platform::_Socket* DoConnectSock(unsigned int port, unsigned int ip, double timeOut) {
    Platform::_Socket* socket = Platform::NewSocket(Platform::ST_TCP);
    if (socket == Platform::kNoSocket) return socket;
    LogUnless(Platform::SetSocketLinger(socket, false, 10), "setsockopt(SO_LINGER)");
    if (timeOut > 0) {
        LogUnless(Platform::SetSocketNonBlocking(socket, true), "ioctlsocket(nonblock)");
        g_ScriptServerLog.PrintF("RemoteApp::Connect - timeout %f\n", timeOut);
    }
    bool isUnderWay = Platform::ConnectSocket(socket, port, ip);
    if (!isUnderWay) {
        Platform::SocketError error = Platform::GetSocketError();
        isUnderWay = error == Platform::SERR_NONE || error == Platform::SERR_INPROGRESS ||
                     error == Platform::SERR_WOULDBLOCK;
        if (!isUnderWay) g_ScriptServerLog.PrintF("RemoteApp::Connect - connect err %d\n", error);
    }
    if (isUnderWay) {
        g_ScriptServerLog.PrintF("RemoteApp::Connect - connect OK\n");
        isUnderWay = AwaitConnect(socket, port, ip, timeOut);
    }
    if (isUnderWay) return socket;
    Platform::DeleteSocket(socket);
    return Platform::kNoSocket;
}

}  // namespace

// By name

// TODO(remote): connects by name, when there is a script server to ask. False so far.
bool RemoteApp::Connect(ScriptVal&) {
    return false;
}
bool RemoteApp::Connect() {
    ScriptVal reply;
    return Connect(reply);
}
bool RemoteApp::AsyncConnect() {
    return false;
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
    if (IsConnectionThread()) {
        g_ScriptServerLog.PrintF("A connection's own thread cannot connect it.\n");
        return false;
    }
    _Disconnect(Platform::kNoTimeLimit);
    {
        AutoAppLock guard(m_Lock);
        m_IP = ip;
    }
    ScriptVal root = GetRoot();
    bool isOwn = port && port == GetListenPort() && IsLocalIP(ip);
    if (isOwn ? !ConnectHere() : !ConnectThere(ip, port)) {
        return false;
    }
    if (ShakeHands(root, reply)) return true;
    Close("the peer has not told who it is, or is not the one who was there before");
    _Disconnect(Platform::kNoTimeLimit);
    return false;
}

bool RemoteApp::ConnectThere(unsigned int ip, unsigned int port) {
    Platform::_Socket* socket = DoConnectSock(port, ip, GetTimeOut());
    return socket != Platform::kNoSocket && Connect(socket);
}

// The peer is this process: the two ends take packets from each other.
bool RemoteApp::ConnectHere() {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    if (IsGUIThread() && config && config->m_Active && config->UIExecute) {
        g_ScriptServerLog.PrintF("The UI thread cannot wait for what it has to do itself.\n");
        return false;
    }
    ptr<ConnectApp> accepted(ConnectApp::New());
    accepted->SetPeer("unknown", "127.0.0.1", kLoopback, ScriptVal());
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
    if (!*uuid.ToString("") || strlen(uuid.ToString()) > kMostUUIDBytes) return false;
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

// Addresses

unsigned int RemoteApp::IPFromStr(const char* text) {
    if (!text) return 0;
    const char* next = text;
    auto skipBlanks = [&] { next += strspn(next, " \t"); };
    std::array<uint8_t, 4> bytes;
    for (size_t i = 0; i < bytes.size(); i++) {
        if (i && *next++ != '.') return Platform::GetHostByName(text);
        skipBlanks();
        int number = *next >= '0' && *next <= '9' ? 0 : 256;
        while (*next >= '0' && *next <= '9' && number < 256) number = number * 10 + *next++ - '0';
        if (number > 255) return Platform::GetHostByName(text);
        bytes[i] = static_cast<uint8_t>(number);
        skipBlanks();
    }
    if (*next == '.') next++;
    skipBlanks();
    return *next ? Platform::GetHostByName(text) : std::bit_cast<unsigned int>(bytes);
}

int RemoteApp::StrFromIP(unsigned int ip, char* text, int length) {
    if (!text || length <= 0) return 0;
    auto bytes = std::bit_cast<std::array<uint8_t, 4>>(ip);
    int written = snprintf(text, static_cast<size_t>(length), "%d.%d.%d.%d", bytes[0], bytes[1],
                           bytes[2], bytes[3]);
    return std::min(written, length - 1);
}

bool RemoteApp::IsLocalIP(unsigned int ip) {
    if (ip == kLoopback) return true;
    char own[kHostNameSize] = "";
    char name[kHostNameSize] = "";
    return Platform::GetHostName(own, kHostNameSize - 1) &&
           Platform::GetHostByAddr(ip, name, kHostNameSize - 1) && strcasecmp(own, name) == 0;
}

bool RemoteApp::IsLocalIP(const char* address) {
    if (!address) return false;
    return strcmp(address, "127.0.0.1") == 0 || IsLocalIP(IPFromStr(address));
}

}  // namespace Korvel

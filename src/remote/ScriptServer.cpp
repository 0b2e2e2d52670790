// The life of the script server: its start, its main loop and its end. What it knows of hosts is in
// HostRegistry.cpp, what it does for callers in ScriptServer_Members.cpp, and what it answers to
// datagrams in ServerDiscovery.cpp.
#include "remote/ScriptServer.h"

#include <poll.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <cinttypes>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <utility>

#include "Platform/Events.h"
#include "Platform/NetworkingInternal.h"
#include "Platform/NoKillInternal.h"
#include "Platform/Processes.h"
#include "Platform/Time.h"
#include "diag/Debug.h"
#include "diag/Env.h"
#include "objects/ScriptConfig.h"
#include "remote/HostAppInternal.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptServerInternal.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr unsigned int kPassMs = 100;
constexpr unsigned int kStandardPort = 1144;
constexpr unsigned int kLastPort = 65535;
constexpr unsigned int kStandardExitDelay = 300;
constexpr unsigned int kNeverExits = UINT32_MAX;

// The number that a setting is. What is none, or too small, is the standard one.
unsigned int ReadSetting(EnvString& setting, unsigned int standard, unsigned int lowest,
                         unsigned int highest, unsigned int above) {
    OxStringT<char> text;
    if (!setting.Get(text)) return standard;
    const char* begin = text;
    const char* end = begin + strlen(begin);
    uint64_t number = 0;
    std::from_chars_result read = std::from_chars(begin, end, number);
    if (read.ptr != end || read.ec != std::errc() || number < lowest) return standard;
    return number > highest ? above : static_cast<unsigned int>(number);
}

EnvString s_Port("KORVEL_ScriptServerPort", false, "");
EnvString s_ExitDelay("KORVEL_ScriptServerExitDelay", false, "");

std::atomic<ScriptServerApp*> g_App{nullptr};

long long GetProcessID() {
    return getpid();
}

// For the log and for people.
void Tell(const char* what, int error) {
    g_ScriptServerLog.PrintF("%s: Error %d\n", what, error);
    PrintServerLine("KorvelScript Server [%lld] %s: Error %d\n", GetProcessID(), what, error);
}

// The server's configuration

ScriptObject* sc_GetApp(void*, TagList*) {
    return g_App;
}

unsigned long long sc_UIExecute(ScriptConfig::UIFunction function, void* a, void* b, bool wait) {
    ScriptServerApp* server = g_App;
    return server ? server->Execute(function, a, b, wait) : 0;
}

void InitConfig(ScriptConfig& sc) {
    auto ignore = [](void*, RemoteApp*, TagList*) {};
    sc.m_AppName = "ScriptServer";
    sc.IsDebugMode = [](void*, TagList*) { return false; };
    sc.GetApp = sc_GetApp;
    sc.OnConnect = sc.OnDisconnect = sc.OnConnectFailed = ignore;
    sc.UIExecute = sc_UIExecute;
}

}  // namespace

unsigned int g_ScriptServerPort = ReadSetting(s_Port, kStandardPort, 1, kLastPort, kStandardPort);
unsigned int g_ScriptServerExitDelay =
    ReadSetting(s_ExitDelay, kStandardExitDelay, 0, kNeverExits, kNeverExits);

// A pipe that can be written to has room for a whole line.
void PrintServerLine(const char* format, ...) {
    char line[512];
    va_list arguments;
    va_start(arguments, format);
    int length = vsnprintf(line, sizeof line, format, arguments);
    va_end(arguments);
    Platform::NoKill noKill;
    pollfd out = {STDOUT_FILENO, POLLOUT, 0};
    if (length <= 0 || poll(&out, 1, 0) != 1 || !(out.revents & POLLOUT)) return;
    auto size = std::min(static_cast<size_t>(length), sizeof line - 1);
    [[maybe_unused]] ssize_t written = write(STDOUT_FILENO, line, size);
}

// The queue

void ExecNode::Run() {
    m_Result = m_Function(m_A, m_B);
    if (m_Done) {
        m_Done->Signal();
    } else {
        Reply();
    }
}

bool ScriptServerApp::Put(std::unique_ptr<ExecNode>& node) {
    if (!node || !m_Queue.Put(node.get())) return false;
    (void)node.release();
    return true;
}

unsigned long long ScriptServerApp::Execute(ExecNode::Function function, void* a, void* b,
                                            bool wait) {
    if (wait && IsGUIThread()) return function(a, b);
    KorvelScript::Event done;
    std::unique_ptr<ExecNode> node(new ExecNode(function, a, b, wait ? &done : nullptr));
    ExecNode* queued = node.get();
    if (!Put(node) || !wait) return 0;
    done.Wait(Platform::kNoTimeLimit);
    unsigned long long result = queued->GetResult();
    queued->Reply();
    return result;
}

void ScriptServerApp::RunQueue() {
    while (auto* node = static_cast<ExecNode*>(m_Queue.Get())) node->Run();
}

// The main loop

struct ScriptServerApp::Sockets {
    ~Sockets() {
        Platform::DeleteSocketSet(m_Set);
        if (m_Datagrams != Platform::kNoSocket) Platform::DeleteSocket(m_Datagrams);
        Platform::DeleteSocketAddress(m_Sender);
    }

    Listener m_Listener;
    Platform::_Socket* m_Datagrams = Platform::kNoSocket;
    Platform::_SocketAddress* m_Sender = nullptr;
    Platform::_SocketSet* m_Set = nullptr;
    int m_ListenerID = 0;
    int m_DatagramsID = 0;
};

bool ScriptServerApp::Open(Sockets& sockets) {
    using namespace Platform;
    unsigned int ip;
    if (!GetListenAddress(ip)) {
        Tell("failed to bind socket", SERR_FAILED);
        return false;
    }
    if (!sockets.m_Listener.Open(g_ScriptServerPort, ip)) {
        bool hasSocket = errno != EMFILE && errno != ENFILE && errno != ENOMEM;
        Tell(hasSocket ? "failed to bind socket" : "failed to create socket", GetSocketError());
        return false;
    }
    sockets.m_Set = NewSocketSet(2);
    sockets.m_ListenerID = AddSocketSet(sockets.m_Set, sockets.m_Listener.GetSocket(), SE_ACCEPT);
    if (!sockets.m_ListenerID) {
        Tell("failed to create socket", SERR_FAILED);
        return false;
    }
    _Socket* datagrams = NewSocket(ST_UDP);
    SetSocketReuseAddress(datagrams, true);
    SetSocketExclusiveAddress(datagrams, true);
    bool hasDatagrams = BindSocket(datagrams, g_ScriptServerPort, ip);
    SocketError error = GetSocketError();
    g_ScriptServerLog.PrintF("Script Server Started\n");
    PrintServerLine("KorvelScript Server [%lld] Started\n", GetProcessID());
    if (hasDatagrams) {
        SetSocketNonBlocking(datagrams, true);
        sockets.m_Datagrams = datagrams;
        sockets.m_Sender = NewSocketAddress(0, 0);
        sockets.m_DatagramsID = AddSocketSet(sockets.m_Set, datagrams, SE_READ | SE_ACCEPT);
    } else {
        g_ScriptServerLog.PrintF("failed to bind pingsocket: Error %d\n", error);
        PrintServerLine("failed to bind pingsocket: Error %d\n", error);
        if (datagrams != kNoSocket) DeleteSocket(datagrams);
    }
    return true;
}

void ScriptServerApp::Main() {
    g_ScriptServerLog.PrintF("ScriptServerApp::Main() enter\n");
    {
        Sockets sockets;
        if (Open(sockets)) Serve(sockets);
    }
    g_ScriptServerLog.PrintF("ScriptServerApp::Main() exit\n");
}

void ScriptServerApp::Serve(Sockets& sockets) {
    for (bool isDone = false; !isDone;) {
        int found = Platform::WaitSocketSet(sockets.m_Set, kPassMs);
        unsigned int calls = 0, datagrams = 0;
        if (found < 0) {
            g_ScriptServerLog.PrintF("select: Error %d\n", Platform::GetSocketError());
        } else {
            calls = Platform::GetSocketSetEvents(sockets.m_Set, sockets.m_ListenerID);
            datagrams = Platform::GetSocketSetEvents(sockets.m_Set, sockets.m_DatagramsID);
        }
        if (calls & Platform::SE_ACCEPT) Accept(sockets);
        if (datagrams) ServeDatagram(sockets);
        if (found != 0 && !calls && !datagrams) Platform::Wait(kPassMs);  // an error may last
        RunQueue();  // connections that have ended count until their clean-up has run
        isDone = IsDone(found == 0);
        PingHosts();
        while (waitpid(-1, nullptr, WNOHANG) > 0) continue;  // hosts that StartHost has started
    }
    m_Queue.Close();
    RunQueue();
    g_ScriptServerLog.PrintF("Script Server Terminated: done: %d, err: %d\n", 1, 0);
    PrintServerLine("KorvelScript Server [%lld] Terminated\n", GetProcessID());
}

void ScriptServerApp::Accept(Sockets& sockets) {
    Platform::_Socket* socket = sockets.m_Listener.Accept();
    if (socket == Platform::kNoSocket) {
        g_ScriptServerLog.PrintF("accepted invalid socket: Error %d\n", Platform::GetSocketError());
        return;
    }
    g_ScriptServerLog.PrintF("Incoming connection\n");
    ptr<HostApp> app(new HostApp(*this));
    m_NumApps++;  // its end may come at once
    if (!app->Start(socket)) m_NumApps--;
}

void ScriptServerApp::Forget(HostApp& app) {
    m_NumApps--;
    HostRegistry::Hosts killed = m_Hosts.RemoveAllOf(&app);
    for (const ScriptHost& host : killed) {
        PrintServerLine("Host '%s' Killed\n", static_cast<const char*>(host.GetPrintName()));
    }
}

void ScriptServerApp::ServeDatagram(Sockets& sockets) {
    char datagram[kMaxDatagram];
    unsigned int length = Platform::SocketReceiveFrom(sockets.m_Datagrams, datagram,
                                                      sizeof datagram, sockets.m_Sender);
    if (length == 0) {
        Platform::SocketError error = Platform::GetSocketError();
        if (error) g_ScriptServerLog.PrintF("ping socket: Error %d\n", error);
        return;
    }
    std::string answer = AnswerDatagram(m_Hosts, {datagram, length}, DescribeMachine());
    unsigned int ip = Platform::SocketAddressGetIP(sockets.m_Sender);
    if (answer.empty() || !m_Limiter.Allow(ip, NowNs() / kNsPerMs)) return;
    Platform::SocketSendTo(sockets.m_Datagrams, answer.data(), static_cast<int>(answer.size()),
                           sockets.m_Sender);
}

// A connection that has ended may still have something on the queue.
bool ScriptServerApp::IsDone(bool hasTimedOut) {
    if (m_NumApps > 0 || GetNumConnections() > 0) {
        m_NumIdlePasses = 0;
        return false;
    }
    g_ScriptServerLog.PrintF("No connections yet, count: %u\n", m_NumIdlePasses);
    if (hasTimedOut) m_NumIdlePasses++;
    unsigned int delay = g_ScriptServerExitDelay;
    return delay != kNeverExits && (m_NumIdlePasses >= delay || g_HasBeenConnected);
}

// What hosts tell of themselves

void ScriptServerApp::PingHosts() {
    for (HostRegistry::DuePing& due : m_Hosts.TakeDuePings(NowNs() / kNsPerMs)) {
        due.m_Proxy.AsyncCallMember(TakePingReply, reinterpret_cast<void*>(due.m_Serial),
                                    "GetPingInfo");
    }
}

namespace {

struct PingReply : Reuser {
    uint64_t m_Serial;
    ScriptVal m_Info;
};

}  // namespace

// On the connection's thread, so that whatever a host sends holds up nobody else.
bool ScriptServerApp::TakePingReply(void* serial, RemoteApp* app, Packet* reply, unsigned int) {
    if (!reply) return true;
    ScriptVal values;
    bool isValid = ScriptVal::FromPacket(app, reply, nullptr, &values);
    FreePkt(reply);
    ScriptServerApp* server = g_App;
    ScriptVal info = HostRegistry::CleanInfo(values.FindKeyConst(-1));
    if (!isValid || !server || !info.IsTable()) return true;
    auto store = [](void* replyPointer, void* serverPointer) -> unsigned long long {
        std::unique_ptr<PingReply> taken(static_cast<PingReply*>(replyPointer));
        static_cast<ScriptServerApp*>(serverPointer)
            ->m_Hosts.SetPingInfo(taken->m_Serial, std::move(taken->m_Info));
        return 0;
    };
    std::unique_ptr<PingReply> taken(new PingReply);
    if (!taken) return true;
    taken->m_Serial = reinterpret_cast<uintptr_t>(serial);
    taken->m_Info = std::move(info);
    std::unique_ptr<ExecNode> node(new ExecNode(store, taken.get(), server, nullptr));
    if (server->Put(node)) (void)taken.release();
    return true;
}

}  // namespace Korvel

void ScriptServerMain() {
    using namespace Korvel;
    static ScriptConfig sc;
    g_ScriptServerLog.PrintF("ScriptServerMain\n");
    Platform::InitProcess();
    InitConfig(sc);
    InitScripting(sc);
    auto* server = new ScriptServerApp;
    if (!server) return;
    server->IncRef();
    g_App = server;
    StartScripting(ScriptVal());
    server->Main();
    CleanupScripting();
    g_App = nullptr;
    server->DecRef();
}

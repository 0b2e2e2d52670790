// How a host stays known to the script server, whoever of the two goes and comes back.
#include <unistd.h>

#include <algorithm>
#include <utility>

#include "Platform/Events.h"
#include "Platform/Threads.h"
#include "diag/Debug.h"
#include "diag/Env.h"
#include "remote/ListenerInternal.h"
#include "remote/RegistrationInternal.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptPortInternal.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr double kFirstTimeOut = 0.01;  // in seconds: a server that runs takes a call at once
constexpr double kMostTimeOut = 5;
constexpr int64_t kAnswerMs = 10000;     // that a server has to answer
constexpr int64_t kStartAgainMs = 1000;  // between attempts to start one
constexpr int64_t kFirstPauseMs = 2;     // between attempts to reach one, doubled up to the most
constexpr int64_t kMostPauseMs = 100;
constexpr double kFarewellTimeOut = 1;      // in seconds, for a server that may be dead
constexpr unsigned int kEndWaitMs = 10000;  // that the thread has to end
constexpr unsigned int kCancelAgainMs = 50;

EnvInt s_RegisterAgainSeconds("KORVEL_RegisterAgainSeconds", true, 10);

// Never destroyed: the thread may run while the process ends.
KorvelScript::Lock& s_ServerLock = *new KorvelScript::Lock;
ScriptVal& g_Server = *new ScriptVal;  // guarded by s_ServerLock, as is g_Host
ScriptVal& g_Host = *new ScriptVal;

// What goes may be the last proxy, which ends a connection: not under the lock.
void SetServer(ScriptVal server) {
    KorvelScript::AutoLock guard(s_ServerLock);
    std::swap(g_Server, server);
}

// Hosts that have lost their server at the same moment do not come back at the same moment.
int64_t GetAgainMs() {
    int64_t ms = std::clamp<int64_t>(s_RegisterAgainSeconds, 0, 86400) * 1000;
    auto spread = static_cast<uint64_t>(NowNs() ^ getpid() * int64_t{2654435761});
    return std::max(ms + static_cast<int64_t>(spread % static_cast<uint64_t>(ms / 2 + 1)),
                    kMostPauseMs);
}

double Seconds(int64_t ns) {
    return static_cast<double>(ns) / (1000 * kNsPerMs);
}

}  // namespace

ScriptVal GetServer() {
    KorvelScript::AutoLock guard(s_ServerLock);
    return g_Server;
}

ScriptVal GetHost() {
    KorvelScript::AutoLock guard(s_ServerLock);
    return g_Host;
}

void LeaveServer() {
    ScriptVal server = GetServer();
    if (RemoteApp* app = server.GetApp()) {
        app->SetTimeOut(kFarewellTimeOut);
        server.CallMember("RemoveHost", getpid());
    }
    SetServer(ScriptVal());
}

// The connection to the server. It tells its registration when it ends.
class ServerApp : public RemoteApp {
public:
    explicit ServerApp(Registration& owner)
        : RemoteApp("", 0, nullptr), m_Owner(ptr<Registration>::Share(&owner)) {}

    void AppThreadFunc() override {
        RemoteApp::AppThreadFunc();
        m_Owner->m_News.Signal();
    }

    // The server is whoever has no name to be asked for.
    bool Open(double timeOut) {
        unsigned int ip = 0;
        GetListenAddress(ip);
        char address[16] = "127.0.0.1";
        if (ip) StrFromIP(ip, address, sizeof(address));
        SetPeer("", address, ip, ScriptVal());
        SetTimeOut(timeOut);
        Enlist();
        m_Root = GetRoot();
        ScriptVal reply;
        return RemoteApp::Connect(reply);
    }

    ScriptVal TakeRoot() { return std::exchange(m_Root, ScriptVal()); }

private:
    const ptr<Registration> m_Owner;
    ScriptVal m_Root;  // of the registration's thread, until it takes it: it holds this connection
};

Registration::Registration(const ScriptVal& info, bool mayStart, void (*whenTried)())
    : m_Info(info), m_MayStart(mayStart), m_WhenTried(whenTried) {}

Registration::~Registration() {
    Platform::DeleteThread(m_Thread);
}

bool Registration::Start() {
    if (!m_News.GetEvent()) return false;
    auto run = [](void* pointer) -> unsigned long long {
        Platform::SetThreadName("ScriptPort [Reg]", nullptr);
        ptr<Registration> self(static_cast<Registration*>(pointer));
        self->Run();
        return 0;
    };
    Use();
    KorvelScript::AutoLock guard(m_Lock);
    m_Thread = Platform::NewThread(run, this, 0, nullptr);
    if (!m_Thread) Recycle();
    return m_Thread;
}

bool Registration::Stop() {
    m_MustStop = true;
    m_News.Signal();
    for (unsigned int waitedMs = 0; waitedMs < kEndWaitMs; waitedMs += kCancelAgainMs) {
        Cancel();  // again, for an attempt that was only about to begin
        if (Platform::WaitThread(m_Thread, kCancelAgainMs)) return true;
    }
    return false;
}

void Registration::Cancel() {
    ptr<ServerApp> app;
    {
        KorvelScript::AutoLock guard(m_Lock);
        app = m_App;
    }
    if (!app) return;
    app->CancelConnect();
    app->_Disconnect(0);
}

void Registration::Run() {
    { KorvelScript::AutoLock wait(m_Lock); }  // until the start is complete
    bool isKnown = Register();
    m_WhenTried();
    while (!m_MustStop) {
        if (isKnown && m_App->Connected()) {
            m_News.Wait(Platform::kNoTimeLimit);
            continue;
        }
        SetServer(ScriptVal());
        EndConnection();
        isKnown = Pause(GetAgainMs()) && Register();
    }
    EndConnection();
}

void Registration::SetApp(ptr<ServerApp> app) {
    KorvelScript::AutoLock guard(m_Lock);
    std::swap(m_App, app);
}

// Stop may have come too early to do it.
void Registration::EndConnection() {
    if (m_App) m_App->_Disconnect(0);
    SetApp({});
}

// False when it must stop.
bool Registration::Pause(int64_t milliseconds) {
    int64_t limitNs = NowNs() + milliseconds * kNsPerMs;
    while (!m_MustStop) {
        int64_t leftNs = limitNs - NowNs();
        if (leftNs <= 0) return true;
        m_News.Wait(static_cast<unsigned int>((leftNs + kNsPerMs - 1) / kNsPerMs));
    }
    return false;
}

bool Registration::Register() {
    int64_t limitNs = NowNs() + kAnswerMs * kNsPerMs;
    int64_t startNs = 0;  // when a server may be started
    int64_t pauseMs = kFirstPauseMs;
    double timeOut = kFirstTimeOut;
    do {
        bool isThere = Connect(timeOut);
        if (isThere && Introduce(kMostTimeOut)) return true;
        int64_t now = NowNs();
        if (now >= limitNs || m_MustStop) break;
        // A server that is slow to answer, or that has just been started, needs no second one.
        if (!isThere && now >= startNs) {
            if (!m_MayStart || !StartServer()) return false;
            startNs = NowNs() + kStartAgainMs * kNsPerMs;
            pauseMs = kFirstPauseMs;
        }
        timeOut = std::min(kMostTimeOut, Seconds(limitNs - now));
    } while (Pause(std::exchange(pauseMs, std::min(pauseMs * 2, kMostPauseMs))));
    if (!m_MustStop)
        g_ScriptServerLog.PrintF("No script server answers; nobody finds this host.\n");
    return false;
}

bool Registration::Connect(double timeOut) {
    SetApp(ptr<ServerApp>(new ServerApp(*this)));
    if (m_App->Open(timeOut)) return true;
    m_App->TakeRoot();
    EndConnection();
    return false;
}

// Stop ends the connection, and with it the call.
bool Registration::Introduce(double timeOut) {
    m_App->SetTimeOut(timeOut);
    ScriptVal server = m_App->TakeRoot();
    ScriptVal host = m_MustStop ? ScriptVal() : server.CallMember("AddHost", m_Info);
    if (host.IsNil()) {
        EndConnection();
        return false;
    }
    SetServer(server);
    KorvelScript::AutoLock guard(s_ServerLock);
    std::swap(g_Host, host);  // what goes does so without the lock
    return true;
}

}  // namespace Korvel

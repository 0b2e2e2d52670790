// The runs of a connection: how one begins and ends, who waits for that, and what the host hears of
// it. The object can run again and again; what belongs to a run carries its number.
#include <algorithm>
#include <cstdio>
#include <utility>

#include "Platform/Events.h"
#include "Platform/Networking.h"
#include "Platform/NetworkingInternal.h"
#include "Platform/Threads.h"
#include "core/0ReusePool.h"
#include "core/ScriptHooksInternal.h"
#include "diag/Debug.h"
#include "diag/Env.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

EnvInt s_PeerTimeoutSeconds("KORVEL_PeerTimeoutSeconds", true, 90);

constinit std::atomic<unsigned int> s_NumConnections{0};

// The connection whose thread this is.
constinit thread_local RemoteApp* t_Connection = nullptr;

}  // namespace

constinit std::atomic<bool> g_HasBeenConnected{false};

unsigned int GetNumConnections() {
    return s_NumConnections;
}

PeerTimeout::PeerTimeout()
    : m_Seconds(static_cast<int>(std::clamp<int64_t>(s_PeerTimeoutSeconds, 3, 86400))) {}

// Beginning

bool RemoteApp::Connect(Platform::_Socket* socket) {
    return ConnectOver(socket, PeerKind::Caller);
}

bool RemoteApp::ConnectOver(Platform::_Socket* socket, PeerKind kind) {
    if (!IsConnectionThread()) _Disconnect(Platform::kNoTimeLimit);
    if (BeginRun()) {
        Platform::SetSocketNonBlocking(socket, true);
        Platform::SetSocketNoDelay(socket, true);
        PeerTimeout timeout;
        Platform::SetSocketKeepAlive(socket, timeout.AskAfter(), timeout.AskEvery(),
                                     PeerTimeout::kNumQuestions);
        ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
        m_Traffic->m_PeerKind = kind;
        m_Traffic->m_IsLoggedIn = !config || !config->WantsLogin();
        uint16_t run = GetRun();
        if (StartThread(socket, nullptr)) return true;
        Cleanup(run);
    }
    Platform::DeleteSocket(socket);
    return false;
}

bool RemoteApp::Join(RemoteApp* a, RemoteApp* b) {
    if (!a || !b || a == b || !a->BeginRun()) return false;
    if (!b->BeginRun()) {
        a->GiveUpRun();
        return false;
    }
    if (!a->StartThread(kInProcess, b)) {
        b->GiveUpRun();
        return false;
    }
    bool isStarted = b->StartThread(kInProcess, a);
    if (isStarted && a->IsPeer(b)) return true;
    (isStarted ? b : a)->_Disconnect(Platform::kNoTimeLimit);  // the other one has ended already
    return false;
}

bool RemoteApp::IsPeer(const RemoteApp* app) const {
    AutoAppLock guard(m_Lock);
    return m_Traffic->m_Peer == app;
}

void RemoteApp::GiveUpRun() {
    AutoAppLock guard(m_Lock);
    m_Traffic->m_IsBeginning = false;
}

// Makes all ready for a new run, which StartThread begins, and waits until the last one has come to
// its very end. False while it runs, where another thread is at it, and where that cannot be waited
// for.
bool RemoteApp::BeginRun() {
    Traffic& traffic = *m_Traffic;
    if (IsConnectionThread()) {
        g_ScriptServerLog.PrintF("A connection's own thread cannot connect it.\n");
        return false;
    }
    {
        AutoAppLock guard(m_Lock);
        if (traffic.m_IsRunning || traffic.m_IsBeginning) return false;
        traffic.m_IsBeginning = true;
    }
    if (!AwaitEnd(0)) {
        GiveUpRun();
        return false;
    }
    Cleanup(GetRun());
    {
        AutoAppLock guard(m_Lock);
        if (++traffic.m_Run == 0) traffic.m_Run = 1;
        traffic.m_MustQuit = traffic.m_WantsEnd = traffic.m_HasEnded = false;
        traffic.m_IsServing = traffic.m_HasInput = traffic.m_IsRefused = false;
        traffic.m_IsLoggedIn = true;
        traffic.m_WhyClosed = nullptr;
        traffic.m_NumSilent = traffic.m_NumUnanswered = 0;
        traffic.m_HeldUntilNs = 0;
        traffic.m_NextDeadlineNs = INT64_MAX;
        traffic.m_QuitLimitNs = traffic.m_OwedSinceNs = 0;
        traffic.m_NextCheckNs = traffic.m_ProgressNs = NowNs();
        traffic.m_HasWritten = traffic.m_IsShut = false;
        traffic.m_Threshold = 1;
        traffic.m_NumInput = traffic.m_NumUsed = traffic.m_NumWritten = traffic.m_NumRead = 0;
    }
    InitReferences();
    return true;
}

// False, and it does not run, without a thread, descriptors or memory, and when it shall not be.
bool RemoteApp::StartThread(Platform::_Socket* socket, RemoteApp* peer) {
    auto start = [](void* pointer) -> unsigned long long {
        auto* app = static_cast<RemoteApp*>(pointer);
        Platform::SetThreadName("RemoteApp", nullptr);
        app->AppThreadFunc();
        app->EndThread();
        app->Recycle();
        return 0;
    };
    AutoAppLock guard(m_Lock);
    Traffic& traffic = *m_Traffic;
    traffic.m_IsBeginning = false;
    Platform::_Thread* thread = nullptr;
    if (!traffic.m_IsCancelled && PrepareLocked(socket)) {
        Use();
        thread = Platform::NewThread(start, this, 0, nullptr);
        if (!thread) Recycle();
    }
    if (!thread) {
        FreeSetLocked();
        return false;
    }
    Platform::DeleteThread(thread);  // whoever waits for its end waits for EndThread
    if (peer) peer->Use();
    traffic.m_Socket = socket;
    traffic.m_Peer = peer;
    traffic.m_HasThread = true;
    traffic.m_IsRunning = true;
    s_NumConnections++;
    g_HasBeenConnected = true;  // behind the count: who sees no connection knows one has gone
    if (m_Flags & PKF_Trace) {
        Platform::NoKill noKill;
        printf("App %p. %lld: Connected to socket %lld\n", static_cast<const void*>(this),
               static_cast<long long>(m_AppID),
               static_cast<long long>(reinterpret_cast<intptr_t>(socket)));
    }
    return true;
}

bool RemoteApp::PrepareLocked(Platform::_Socket* socket) {
    Traffic& traffic = *m_Traffic;
    traffic.m_Set = Platform::NewSocketSet(3);
    traffic.m_WakeEvent = Platform::AddSocketSet(traffic.m_Set, 0, 0);
    traffic.m_SocketEntry = 0;
    if (!traffic.m_WakeEvent || socket == kInProcess) return traffic.m_WakeEvent;
    traffic.m_SocketEntry =
        Platform::AddSocketSet(traffic.m_Set, socket, Platform::SE_READ | Platform::SE_CLOSE);
    traffic.m_Input = static_cast<unsigned char*>(g_ReusePoolMgr.Alloc(Traffic::kInputSize));
    return traffic.m_SocketEntry && traffic.m_Input;
}

void RemoteApp::FreeSetLocked() {
    Platform::DeleteSocketSet(std::exchange(m_Traffic->m_Set, nullptr));
    g_ReusePoolMgr.Free(std::exchange(m_Traffic->m_Input, nullptr));
}

bool RemoteApp::IsConnectionThread() const {
    return t_Connection == this;
}

void RemoteApp::AppThreadFunc() {
    t_Connection = this;
    { AutoAppLock wait(m_Lock); }  // until the start is complete
    HoldRoot();
    do {
        Sleep();
    } while (Serve());
    CloseDown();
}

uint16_t RemoteApp::GetRun() const {
    AutoAppLock guard(m_Lock);
    return m_Traffic->m_Run;
}
bool RemoteApp::IsRun(uint16_t run) const {
    AutoAppLock guard(m_Lock);
    return m_Traffic->m_IsRunning && m_Traffic->m_Run == run;
}

// Ending

void RemoteApp::Disconnect() {
    {
        AutoAppLock guard(m_Lock);
        m_Traffic->m_WantsEnd = true;
    }
    Wake();
}

// After a run that has ended already there may be its last steps to wait for.
bool RemoteApp::_Disconnect(unsigned int waitMs) {
    bool isFromUI = IsGUIThread();
    bool wasRunning;
    const char* refusal;
    {
        AutoAppLock guard(m_Lock);
        wasRunning = m_Traffic->m_IsRunning;
        if (wasRunning) m_Traffic->m_MustQuit = true;
        refusal = IsConnectionThread() ? nullptr : WhyNotWait(isFromUI);
    }
    if (wasRunning) Wake();
    if (IsConnectionThread()) return wasRunning;
    if (refusal) {
        g_ScriptServerLog.PrintF("%s\n", refusal);
        return false;
    }
    int64_t deadlineNs = waitMs == Platform::kNoTimeLimit ? 0 : DeadlineAfter(waitMs * 1e-3 + 1e-9);
    return AwaitEnd(deadlineNs) && wasRunning;
}

// Waits until the connection has no thread, or until the deadline; 0 is none. The waiter is not on
// the stack, which goes when the thread is killed.
bool RemoteApp::AwaitEnd(int64_t deadlineNs) {
    Traffic& traffic = *m_Traffic;
    auto* waiter = new EndWaiter;
    if (!waiter) return false;
    waiter->m_IsFromUI = IsGUIThread();
    {
        AutoAppLock guard(m_Lock);
        if (traffic.m_HasThread && !WhyNotWait(waiter->m_IsFromUI)) {
            waiter->m_Next = std::exchange(traffic.m_EndWaiters, waiter);
        } else {
            (void)waiter->EndQuietly();
        }
    }
    waiter->Wait(deadlineNs);
    bool hasEnded;
    {
        AutoAppLock guard(m_Lock);
        for (EndWaiter** link = &traffic.m_EndWaiters; *link; link = &(*link)->m_Next) {
            if (*link == waiter) {
                *link = waiter->m_Next;
                break;
            }
        }
        hasEnded = !traffic.m_HasThread;
    }
    delete waiter;
    return hasEnded;
}

// The last step of the thread.
void RemoteApp::EndThread() {
    AutoAppLock guard(m_Lock);
    m_Traffic->m_HasThread = false;
    while (EndWaiter* waiter = m_Traffic->m_EndWaiters) {
        m_Traffic->m_EndWaiters = waiter->m_Next;
        waiter->End();
    }
}

// What a member of this connection's thread waits for is the UI thread, which therefore must not
// wait for what only this thread can bring.
void RemoteApp::NoteWaitForUI(bool isWaiting) {
    RemoteApp* app = t_Connection;
    if (!app) return;
    app->m_Traffic->m_IsWaitingForUI = isWaiting;
    if (!isWaiting) return;
    app->ReleaseUI();
    // Only this thread takes the peer away.
    RemoteApp* peer = app->m_Traffic->m_Peer;
    if (peer && peer->IsPeer(app)) peer->ReleaseUI();
}

void RemoteApp::ReleaseUI() {
    int count = 0;
    auto release = [&count](Waiter& waiter) {
        if (!waiter.m_IsFromUI || waiter.IsOver()) return;
        waiter.End();
        count++;
    };
    {
        AutoAppLock guard(m_Lock);
        m_Traffic->m_Requests.ForEach([&](Request& request) {
            if (request.m_HasWaiter) release(request.m_Waiter);
        });
        for (EndWaiter* waiter = m_Traffic->m_EndWaiters; waiter; waiter = waiter->m_Next) {
            release(*waiter);
        }
    }
    if (count == 0) return;
    g_ScriptServerLog.PrintF(
        "The UI thread does not wait for a peer any more whose own call waits for the UI "
        "thread.\n");
}

// Tells the other one that this one goes. Nothing over a socket.
void RemoteApp::LeavePeer() {
    RemoteApp* peer;
    {
        AutoAppLock guard(m_Lock);
        peer = std::exchange(m_Traffic->m_Peer, nullptr);
    }
    if (!peer) return;
    {
        AutoAppLock guard(peer->m_Lock);
        if (peer->m_Traffic->m_Peer == this) peer->m_Traffic->m_MustQuit = true;
    }
    peer->Wake();
    peer->Recycle();
}

void RemoteApp::CloseDown() {
    Traffic& traffic = *m_Traffic;
    if (const char* why = traffic.m_WhyClosed) {
        g_ScriptServerLog.PrintF("Connection to %s closed: %s.\n",
                                 static_cast<const char*>(GetName()), why);
    }
    FreePkt(std::exchange(traffic.m_Writing, nullptr));
    FreePkt(std::exchange(traffic.m_Following, nullptr));
    FreePkt(std::exchange(traffic.m_Reading, nullptr));
    Platform::_Socket* socket;
    Request* requests = nullptr;
    ScriptVal stateData;  // may hold proxies, and with them this connection
    {
        AutoAppLock guard(m_Lock);
        socket = std::exchange(traffic.m_Socket, nullptr);
        for (Request* taken = traffic.m_Requests.TakeIf([](Request&) { return true; }); taken;) {
            Request* request = std::exchange(taken, taken->m_Next);
            if (request->m_HasWaiter) {
                request->m_Waiter.End();
            } else {
                request->m_Next = std::exchange(requests, request);
            }
        }
        while (Packet* packet = traffic.m_Outgoing.Take()) FreePkt(packet);
        FreeSetLocked();
        std::swap(m_StateData, stateData);
        traffic.m_IsRunning = false;
    }
    if (socket != kInProcess) Platform::DeleteSocket(socket);
    LeavePeer();
    ReportEnd();
    stateData = SV_Nil;
    DropRequests(requests);
    // Who sees no connection may take the configuration away.
    if (--s_NumConnections == 0) FreeSparePackets();
}

// Telling the host

namespace {

using HostCallback = void (*ScriptConfig::*)(void* userData, RemoteApp* app, TagList* tags);

void TellHost(HostCallback callback, RemoteApp* app) {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    if (config && config->*callback) (config->*callback)(config->m_UserData, app, nullptr);
}

}  // namespace

// Queues a step that ends with Recycle, and knows the run. False where the host has no UI thread
// for it.
bool RemoteApp::RunOnUI(UIStep step) {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    if (!config || !config->m_Active || !config->UIExecute) return false;
    Use();
    config->UIExecute(step, this, reinterpret_cast<void*>(uintptr_t{GetRun()}), false);
    return true;
}

// On the UI thread, so that the host hears of the end after the beginning, and of both or neither.
void RemoteApp::ReportConnect() {
    RunOnUI(TellConnect);
}

// The last step of a run. What the peer held goes on the UI thread, too: it may be the host's own.
void RemoteApp::ReportEnd() {
    if (RunOnUI(TellEnd)) return;
    SetReported(false);  // the host has stopped scripting
    Cleanup(GetRun());
}

// Returns whether there is something to tell: a run that has ended before has no beginning, and so
// no end.
bool RemoteApp::SetReported(bool isReported) {
    AutoAppLock guard(m_Lock);
    Traffic& traffic = *m_Traffic;
    bool wasReported = std::exchange(traffic.m_IsReported, isReported && traffic.m_IsRunning);
    return isReported ? traffic.m_IsReported : wasReported;
}

unsigned long long RemoteApp::TellConnect(void* appPointer, void* run) {
    auto* app = static_cast<RemoteApp*>(appPointer);
    bool isCurrent = app->IsRun(static_cast<uint16_t>(reinterpret_cast<uintptr_t>(run)));
    if (isCurrent && app->SetReported(true)) TellHost(&ScriptConfig::OnConnect, app);
    app->Recycle();
    return 0;
}

unsigned long long RemoteApp::TellConnectFailed(void* appPointer, void*) {
    auto* app = static_cast<RemoteApp*>(appPointer);
    TellHost(&ScriptConfig::OnConnectFailed, app);
    app->Recycle();
    return 0;
}

unsigned long long RemoteApp::TellEnd(void* appPointer, void* run) {
    auto* app = static_cast<RemoteApp*>(appPointer);
    if (app->SetReported(false)) TellHost(&ScriptConfig::OnDisconnect, app);
    app->Cleanup(static_cast<uint16_t>(reinterpret_cast<uintptr_t>(run)));
    app->Recycle();
    return 0;
}

[[maybe_unused]] static const bool s_IsHooked =
    (g_ScriptHooks.m_SetWaitingForUI = RemoteApp::NoteWaitForUI, true);

}  // namespace Korvel

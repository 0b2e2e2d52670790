// What any thread does with a connection. The connection's own thread is in RemoteApp_Thread.cpp,
// what it does with packets in RemoteApp_Dispatch.cpp, objects in RemoteApp_References.cpp.
#include "remote/RemoteApp.h"

#include <sched.h>

#include <memory>
#include <new>

#include "Platform/Events.h"
#include "Platform/Networking.h"
#include "Platform/NoKillInternal.h"
#include "Platform/Threads.h"
#include "core/0ReusePool.h"
#include "core/ScriptHooksInternal.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr int kMostNameBytes = 127;

std::atomic<uint64_t> s_NextAppID{1};

// At most 127 bytes of a name, and no broken character at the end.
OxStringT<char> CutName(const char* name) {
    OxStringT<char> whole(name);
    int length = whole.GetLength();
    if (length <= kMostNameBytes) return whole;
    length = kMostNameBytes;
    while (length > 0 && (name[length] & 0xC0) == 0x80) length--;
    return whole.Left(length);
}

}  // namespace

RemoteApp::RemoteApp(const char* name, unsigned int ip, Platform::_Socket* socket)
    : m_AppID(s_NextAppID++), m_Traffic(new Traffic), m_Name(CutName(name)), m_IP(ip) {
    InitReferences();
    if (socket) Connect(socket);
}

// Nothing runs any more: a running thread holds a use.
RemoteApp::~RemoteApp() {
    FreeReferences();
    if (Platform::_Thread* thread = m_Traffic->m_Thread) {
        // The thread may be this one, at its very end.
        if (m_Traffic->m_ThreadID != Platform::GetCurrentThreadID()) {
            Platform::WaitThread(thread, Platform::kNoTimeLimit);
        }
        Platform::DeleteThread(thread);
    }
    Platform::DeleteSocketSet(m_Traffic->m_Set);
    g_ReusePoolMgr.Free(m_Traffic->m_Input);
    delete m_Traffic;
}

void RemoteApp::Use() const {
    m_UseCount.fetch_add(1, std::memory_order_relaxed);
}
void RemoteApp::Recycle() const {
    if (m_UseCount.fetch_sub(1, std::memory_order_acq_rel) == 1) delete this;
}

bool RemoteApp::IsConnectionThread() const {
    return m_Traffic->m_ThreadID.load(std::memory_order_relaxed) == Platform::GetCurrentThreadID();
}

// Sending

// The thread looks at m_HasWork before it sleeps, and says so before that.
void RemoteApp::Wake() {
    Traffic& traffic = *m_Traffic;
    traffic.m_HasWork.store(true);
    if (traffic.m_IsAsleep.load()) Platform::SocketSetEvent(traffic.m_Set, traffic.m_WakeEvent);
}

// Under the lock. Puts a packet on the queue; false without memory.
bool RemoteApp::PostLocked(Packet* packet) {
    if ((m_Flags | packet->m_Flags) & PKF_Trace) DumpPacket(packet, this, "Send");
    return m_Traffic->m_Outgoing.Add(packet);
}

uint32_t RemoteApp::Submit(Packet* packet, Request* request) {
    uint32_t context = 0;
    RemoteApp* reader = this;
    {
        Platform::NoKill noKill;
        KorvelScript::AutoLock guard(m_Lock);
        Traffic& traffic = *m_Traffic;
        if (!traffic.m_IsRunning || !request) return 0;
        if (++traffic.m_LastContext == 0) traffic.m_LastContext = 1;
        packet->m_Context = request->m_Context = context = traffic.m_LastContext;
        if (!traffic.m_Requests.Add(request)) return 0;
        if (!PostLocked(packet)) {
            traffic.m_Requests.Remove(request);
            return 0;
        }
        if (request->m_DeadlineNs && request->m_DeadlineNs < traffic.m_NextDeadlineNs) {
            traffic.m_NextDeadlineNs = request->m_DeadlineNs;
            Wake();  // our own thread sleeps until another one
        }
        if (traffic.m_Peer) {
            reader = traffic.m_Peer;
            reader->Use();
        }
    }
    reader->Wake();
    if (reader != this) reader->Recycle();
    return context;
}

uint32_t RemoteApp::SendPkt(Packet* packet) {
    if (!packet) return 0;
    if (packet->m_Type == PKT_Reply) return SendReplyPkt(packet);
    std::unique_ptr<Request> request(new Request);
    uint32_t context = Submit(packet, request.get());
    if (context) {
        (void)request.release();
    } else {
        FreePkt(packet);
    }
    return context;
}

uint32_t RemoteApp::SendReplyPkt(Packet* packet) {
    uint32_t context = packet->m_Context;
    RemoteApp* reader = this;
    {
        Platform::NoKill noKill;
        KorvelScript::AutoLock guard(m_Lock);
        Traffic& traffic = *m_Traffic;
        if (traffic.m_NumUnanswered) traffic.m_NumUnanswered--;
        if (!traffic.m_IsRunning || !PostLocked(packet)) context = 0;
        if (context && traffic.m_Peer) {
            reader = traffic.m_Peer;
            reader->Use();
        }
    }
    if (!context) {
        FreePkt(packet);
    } else {
        reader->Wake();
    }
    if (reader != this) reader->Recycle();
    return context;
}

Packet* RemoteApp::DoPkt(Packet* packet) {
    if (!packet || !Connected()) return nullptr;
    return ExchangePkt(packet);
}

Packet* RemoteApp::ExchangePkt(Packet* packet) {
    if (!packet) return nullptr;
    std::unique_ptr<Request> request(new Request);
    bool canWait = CanWait();
    if (request) request->m_HasWaiter = true;
    if (!canWait || !Submit(packet, request.get())) {
        FreePkt(packet);
        return nullptr;
    }
    return WaitFor(request.release(), GetTimeOut());
}

uint32_t RemoteApp::DoPktAsync(Packet* packet, AsyncCallback callback, void* data) {
    if (!packet) return 0;
    std::unique_ptr<Request> request(new Request);
    if (!request) return 0;
    request->m_IsAsync = true;
    request->m_Callback = callback;
    request->m_Data = data;
    double seconds = GetTimeOut();
    if (seconds > 0) request->m_DeadlineNs = NowNs() + static_cast<int64_t>(seconds * 1e9);
    uint32_t context = Submit(packet, request.get());
    if (context) (void)request.release();
    return context;
}

// Waiting

// A thread that would deliver the reply itself cannot wait for it.
bool RemoteApp::CanWait() const {
    if (!IsConnectionThread()) return true;
    g_ScriptHooks.m_Log("A connection's own thread cannot wait for a reply on it.");
    return false;
}

Packet* RemoteApp::PollPkt(uint32_t context) {
    return WaitPkt(context, -1);
}
Packet* RemoteApp::WaitPkt(uint32_t context) {
    return WaitPkt(context, GetTimeOut());
}

Packet* RemoteApp::WaitPkt(uint32_t context, double timeOut) {
    Request* request;
    {
        Platform::NoKill noKill;
        KorvelScript::AutoLock guard(m_Lock);
        Traffic& traffic = *m_Traffic;
        if (!traffic.m_IsRunning) return nullptr;
        request = traffic.m_Requests.Find(context);
        if (!request || request->m_IsAsync || request->m_HasWaiter) return nullptr;
        if (!request->m_IsOver && (timeOut < 0 || !CanWait())) return nullptr;
        request->m_HasWaiter = true;
    }
    return WaitFor(request, timeOut);
}

// Waits for the reply to a request that is in the table and marked as this thread's; ends the
// request.
Packet* RemoteApp::WaitFor(Request* request, double timeOut) {
    Use();
    if (!LookForReply(*request)) {
        double ms = timeOut * 1000;
        bool hasLimit = timeOut > 0 && ms < static_cast<double>(Platform::kNoTimeLimit);
        request->m_Event.Wait(hasLimit ? static_cast<unsigned int>(ms) : Platform::kNoTimeLimit);
    }
    Packet* reply;
    {
        Platform::NoKill noKill;
        KorvelScript::AutoLock guard(m_Lock);
        m_Traffic->m_Requests.Remove(request);
        reply = request->m_Reply;
    }
    delete request;
    Recycle();
    return reply;
}

// Looks for a short while, and gives way to other threads meanwhile. True when the wait is over.
bool RemoteApp::LookForReply(const Request& request) {
    static thread_local LookAgain t_Look;
    int64_t budget = t_Look.GetBudgetNs();
    if (!budget) return request.m_IsOver;
    int64_t limit = NowNs() + budget;
    bool isOver;
    while (!(isOver = request.m_IsOver) && NowNs() < limit) sched_yield();
    t_Look.Note(isOver);
    return isOver;
}

// State

bool RemoteApp::Connected() const {
    KorvelScript::AutoLock guard(m_Lock);
    return m_Traffic->m_IsRunning;
}
Platform::_Socket* RemoteApp::GetSocket() const {
    KorvelScript::AutoLock guard(m_Lock);
    return m_Traffic->m_Socket;
}
unsigned int RemoteApp::GetIPAddress() const {
    return m_IP;
}
OxStringT<char> RemoteApp::GetName() const {
    KorvelScript::AutoLock guard(m_Lock);
    return m_Name;
}
OxStringT<char> RemoteApp::GetHostName() const {
    KorvelScript::AutoLock guard(m_Lock);
    return m_HostName;
}
ScriptVal RemoteApp::GetUUID() const {
    KorvelScript::AutoLock guard(m_Lock);
    return m_UUID;
}
bool RemoteApp::IsUUID(const ScriptVal& uuid) const {
    KorvelScript::AutoLock guard(m_Lock);
    return uuid.IsString() && m_UUID == uuid;
}
bool RemoteApp::ClearUUID() {
    KorvelScript::AutoLock guard(m_Lock);
    if (m_Traffic->m_IsRunning) return false;
    m_UUID = SV_Nil;
    return true;
}

void RemoteApp::SetConnectionInfo(ScriptVal& args) {
    const ScriptVal& uuid = args.FindKeyConst(2);
    OxStringT<char> name = CutName(args.FindKeyConst(1).ToString(""));
    KorvelScript::AutoLock guard(m_Lock);
    m_Name = name;
    if (uuid.IsString()) m_UUID = uuid;
}

double RemoteApp::SetTimeOut(double seconds) {
    KorvelScript::AutoLock guard(m_Lock);
    return std::exchange(m_TimeOut, seconds > 0 ? seconds : 0);
}
double RemoteApp::GetTimeOut() const {
    KorvelScript::AutoLock guard(m_Lock);
    return m_TimeOut;
}

void RemoteApp::SetLastError(uint32_t number, const char* text) {
    KorvelScript::AutoLock guard(m_Lock);
    m_LastError = number;
    m_LastErrorText = text;
}
uint32_t RemoteApp::TakeLastError(OxStringT<char>& text) {
    KorvelScript::AutoLock guard(m_Lock);
    text = std::exchange(m_LastErrorText, OxStringT<char>());
    return std::exchange(m_LastError, 0);
}

ScriptVal& RemoteApp::LockData(const char* key) {
    m_DataLock.ObtainLock();
    m_Data.Ensure(SV_Table);
    ScriptVal& data = m_Data.FindKey(key);
    data.Ensure(SV_Table);
    return data;
}
void RemoteApp::UnlockData() {
    m_DataLock.ReleaseLock();
}

void RemoteApp::SetStateData(const ScriptVal& data) {
    ScriptVal replaced = data;  // goes when the lock has been let go of
    {
        KorvelScript::AutoLock guard(m_Lock);
        std::swap(m_StateData, replaced);
    }
    Packet* packet = CreatePkt(PKT_SetStateData, this, nullptr, &data);
    if (packet && !DoPktAsync(packet, nullptr, nullptr)) FreePkt(packet);
}

// Connecting and ending. By name and by address is the work of a layer above.

bool RemoteApp::Connect(unsigned int, unsigned int, ScriptVal&) {
    return false;
}
bool RemoteApp::Connect(ScriptVal&) {
    return false;
}
bool RemoteApp::Connect() {
    return false;
}
bool RemoteApp::AsyncConnect() {
    return false;
}

void RemoteApp::Disconnect() {
    {
        KorvelScript::AutoLock guard(m_Lock);
        m_Traffic->m_WantsEnd = true;
    }
    Wake();
}

bool RemoteApp::_Disconnect(unsigned int waitMs) {
    Platform::_Thread* thread;
    {
        KorvelScript::AutoLock guard(m_Lock);
        if (!m_Traffic->m_IsRunning) return false;
        thread = m_Traffic->m_Thread;
    }
    m_Traffic->m_MustQuit = true;
    Wake();
    return IsConnectionThread() || Platform::WaitThread(thread, waitMs);
}

void RemoteApp::Close(const char* why) {
    OxID line;
    line.PrintF("Connection to %s closed: %s", static_cast<const char*>(GetName()), why);
    g_ScriptHooks.m_Log(line);
    m_Traffic->m_MustClose = true;
    Wake();
}

int RemoteApp::WriteData(void* data, int length) {
    return Platform::SocketSend(m_Traffic->m_Socket, data, length);
}
int RemoteApp::ReadData(void* data, int length) {
    return Platform::SocketReceive(m_Traffic->m_Socket, data, length, nullptr, nullptr);
}

}  // namespace Korvel

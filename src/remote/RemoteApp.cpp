// What any thread does with a connection. How it is made is in RemoteApp_Connect.cpp, the
// connection's own thread in RemoteApp_Thread.cpp, what it does with packets in
// RemoteApp_Dispatch.cpp, objects in RemoteApp_References.cpp.
#include "remote/RemoteApp.h"

#include <memory>
#include <new>

#include "Platform/Networking.h"
#include "core/0ReusePool.h"
#include "diag/Debug.h"
#include "objects/ScriptConfig.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr int kMostNameBytes = 127;

std::atomic<uint64_t> s_NextAppID{1};

}  // namespace

// At most 127 bytes of a name, no broken character at the end, and nothing that a terminal would
// obey: U+0080 to U+009F are such characters, too.
OxStringT<char> RemoteApp::CutName(const char* name) {
    char text[kMostNameBytes + 1];
    int length = 0;
    for (; name && *name; name++) {
        auto byte = static_cast<unsigned char>(*name);
        bool isPair = byte == 0xC2 && (name[1] & 0xE0) == 0x80;
        if (isPair) name++;
        if (isPair || byte < 0x20 || byte == 0x7F) continue;
        if (length == kMostNameBytes) {
            bool isInside = (byte & 0xC0) == 0x80;
            while (isInside && length > 0) isInside = (text[--length] & 0xC0) == 0x80;
            break;
        }
        text[length++] = *name;
    }
    text[length] = 0;
    return OxStringT<char>(text);
}

RemoteApp::RemoteApp(const char* name, unsigned int ip, Platform::_Socket* socket)
    : m_AppID(s_NextAppID++), m_Traffic(new Traffic), m_Name(CutName(name)), m_IP(ip) {
    InitReferences();
    if (socket && Connect(socket)) ReportConnect();
}

// Nothing runs any more: a running thread holds a use.
RemoteApp::~RemoteApp() {
    Delist();
    FreeReferences();
    m_StateData = SV_Nil;  // values are foreign code, and may still ask for what follows
    m_Data = SV_Nil;
    delete m_Traffic;
}

void RemoteApp::Use() const {
    m_UseCount.fetch_add(1, std::memory_order_relaxed);
}
void RemoteApp::Recycle() const {
    if (m_UseCount.fetch_sub(1, std::memory_order_acq_rel) == 1) delete this;
}

// Sending

// The thread looks at m_HasWork before it sleeps, and says so before that.
void RemoteApp::Wake() {
    Traffic& traffic = *m_Traffic;
    traffic.m_HasWork.store(true);
    if (!traffic.m_IsAsleep.load()) return;
    AutoAppLock guard(m_Lock);  // the set goes with the run
    if (traffic.m_Set) Platform::SocketSetEvent(traffic.m_Set, traffic.m_WakeEvent);
}

// Under the lock. Puts a packet on the queue; false without memory, and when that has become too
// long.
bool RemoteApp::PostLocked(Packet* packet, uint64_t maxQueueSize) {
    packet->m_Reserved = 0;
    if ((m_Flags | packet->m_Flags) & PKF_Trace) DumpPacket(packet, this, "Send");
    PacketQueue& queue = m_Traffic->m_Outgoing;
    if (!queue.IsEmpty() && queue.GetBytes() + packet->m_Size > maxQueueSize) {
        Close("too much waits to be sent");
        return false;
    }
    return queue.Add(packet);
}

// Queues a request. Without a record of it the reply is dropped when it comes.
uint32_t RemoteApp::Submit(Packet* packet, Request* request) {
    uint64_t maxQueueSize = GetMaxQueueSize();  // may ask the host
    const char* refusal = nullptr;
    uint32_t context = 0;
    RemoteApp* reader = this;
    {
        AutoAppLock guard(m_Lock);
        Traffic& traffic = *m_Traffic;
        bool isLate = packet->m_Reserved && packet->m_Reserved != traffic.m_Run;
        if (!traffic.m_IsRunning || isLate) return 0;
        if (request && request->m_HasWaiter) refusal = WhyNotWait(request->m_Waiter.m_IsFromUI);
        if (!refusal) {
            if (++traffic.m_LastContext == 0) traffic.m_LastContext = 1;
            packet->m_Context = context = traffic.m_LastContext;
            if (!AddLocked(request, context)) return 0;
            if (!PostLocked(packet, maxQueueSize)) {
                if (request) traffic.m_Requests.Remove(request);
                return 0;
            }
            if (!request) traffic.m_NumSilent++;
            reader = HoldReaderLocked();
        }
    }
    if (refusal) {
        g_ScriptServerLog.PrintF("%s\n", refusal);
        return 0;
    }
    reader->Wake();
    reader->Recycle();
    return context;
}

bool RemoteApp::AddLocked(Request* request, uint32_t context) {
    if (!request) return true;
    Traffic& traffic = *m_Traffic;
    request->m_Context = context;
    request->m_Run = traffic.m_Run;
    if (!traffic.m_Requests.Add(request)) return false;
    if (request->m_DeadlineNs && request->m_DeadlineNs < traffic.m_NextDeadlineNs) {
        traffic.m_NextDeadlineNs = request->m_DeadlineNs;
        Wake();  // the thread sleeps until another one
    }
    return true;
}

// Whose thread takes what is queued here; the caller recycles it.
RemoteApp* RemoteApp::HoldReaderLocked() {
    RemoteApp* reader = m_Traffic->m_Peer ? m_Traffic->m_Peer : this;
    reader->Use();
    return reader;
}

uint32_t RemoteApp::SendPkt(Packet* packet) {
    if (!packet) return 0;
    if (packet->m_Type == PKT_Reply) return SendReplyPkt(packet);
    std::unique_ptr<Request> request(new Request);
    uint32_t context = request ? Submit(packet, request.get()) : 0;
    if (context) {
        (void)request.release();
    } else {
        FreePkt(packet);
    }
    return context;
}

// A peer may number its requests as it likes, with 0, too.
uint32_t RemoteApp::SendReplyPkt(Packet* packet) {
    uint64_t maxQueueSize = GetMaxQueueSize();
    uint32_t context = packet->m_Context;
    RemoteApp* reader;
    {
        AutoAppLock guard(m_Lock);
        Traffic& traffic = *m_Traffic;
        bool isLate = packet->m_Reserved && packet->m_Reserved != traffic.m_Run;
        if (!isLate && traffic.m_NumUnanswered) traffic.m_NumUnanswered--;
        if (isLate || !traffic.m_IsRunning) {
            reader = nullptr;
        } else if (PostLocked(packet, maxQueueSize)) {
            reader = HoldReaderLocked();
        } else {
            reader = nullptr;
            Close(kNoMemoryForReply);
        }
    }
    if (!reader) {
        FreePkt(packet);
        return 0;
    }
    reader->Wake();
    reader->Recycle();
    return context;
}

Packet* RemoteApp::DoPkt(Packet* packet) {
    if (!packet || !Connected()) return nullptr;
    return ExchangePkt(packet);
}

Packet* RemoteApp::ExchangePkt(Packet* packet) {
    std::unique_ptr<Request> request = Ask(packet, false);
    return request ? request->m_Reply : nullptr;
}

bool RemoteApp::Exchange(Packet* packet, ScriptVal& result) {
    std::unique_ptr<Request> request = Ask(packet, true);
    if (!request) return false;
    if (Packet* reply = request->m_Reply) {
        bool isCurrent = GetRun() == request->m_Run;  // what it names belongs to its run
        bool isValid = isCurrent && ScriptVal::FromPacket(this, reply, nullptr, &result);
        FreePkt(reply);
        if (isCurrent && !isValid) Close(kNoValues, request->m_Run);
        return isValid;
    }
    if (request->m_HasValues) result = std::move(request->m_Values);
    return request->m_HasValues;
}

// Sends a packet, which it takes over, and waits for what comes. Null when it could not be sent.
std::unique_ptr<Request> RemoteApp::Ask(Packet* packet, bool wantsValues) {
    std::unique_ptr<Request> request(packet ? new Request : nullptr);
    if (request) {
        request->m_HasWaiter = true;
        request->m_WantsValues = wantsValues;
        request->m_Waiter.m_IsFromUI = IsGUIThread();
    }
    if (!request || !Submit(packet, request.get())) {
        FreePkt(packet);
        return nullptr;
    }
    return WaitFor(request.release(), GetTimeOut());
}

uint32_t RemoteApp::DoPktAsync(Packet* packet, AsyncCallback callback, void* data) {
    if (!packet) return 0;
    if (!callback) return Submit(packet, nullptr);
    std::unique_ptr<Request> request(new Request);
    if (!request) return 0;
    request->m_IsAsync = true;
    request->m_Callback = callback;
    request->m_Data = data;
    request->m_DeadlineNs = DeadlineAfter(GetTimeOut());
    uint32_t context = Submit(packet, request.get());
    if (context) (void)request.release();
    return context;
}

// Waiting

// Under the lock. A thread that has to deliver the reply, or that this thread takes to end its own
// wait, cannot be waited for.
const char* RemoteApp::WhyNotWait(bool isFromUI) const {
    const Traffic& traffic = *m_Traffic;
    const RemoteApp* peer = traffic.m_Peer;
    if (IsConnectionThread() || (peer && peer->IsConnectionThread())) {
        return "A connection's own thread cannot wait for a reply on it.";
    }
    bool isWaitedFor =
        traffic.m_IsWaitingForUI || (peer && peer->m_Traffic->m_IsWaitingForUI.load());
    if (isFromUI && isWaitedFor) {
        return "The UI thread cannot wait for a peer whose own call waits for the UI thread.";
    }
    return nullptr;
}

bool RemoteApp::MayWait() const {
    const char* refusal;
    {
        AutoAppLock guard(m_Lock);
        refusal = WhyNotWait(IsGUIThread());
    }
    if (refusal) g_ScriptServerLog.PrintF("%s\n", refusal);
    return !refusal;
}

Packet* RemoteApp::PollPkt(uint32_t context) {
    return WaitPkt(context, -1);
}
Packet* RemoteApp::WaitPkt(uint32_t context) {
    return WaitPkt(context, GetTimeOut());
}

Packet* RemoteApp::WaitPkt(uint32_t context, double timeOut) {
    Request* request;
    const char* refusal = nullptr;
    {
        AutoAppLock guard(m_Lock);
        Traffic& traffic = *m_Traffic;
        if (!traffic.m_IsRunning) return nullptr;
        request = traffic.m_Requests.Find(context);
        if (!request || request->m_IsAsync || request->m_HasWaiter) return nullptr;
        if (!request->m_Waiter.IsOver()) {
            if (timeOut < 0) return nullptr;
            request->m_Waiter.m_IsFromUI = IsGUIThread();
            refusal = WhyNotWait(request->m_Waiter.m_IsFromUI);
        }
        request->m_HasWaiter = !refusal;
    }
    if (!refusal) return WaitFor(request, timeOut)->m_Reply;
    g_ScriptServerLog.PrintF("%s\n", refusal);
    return nullptr;
}

// Waits for the reply to a request that is marked as this thread's, and takes it over.
std::unique_ptr<Request> RemoteApp::WaitFor(Request* request, double timeOut) {
    Use();
    request->m_Waiter.Wait(DeadlineAfter(timeOut));
    {
        AutoAppLock guard(m_Lock);
        if (request->m_IsInTable) m_Traffic->m_Requests.Remove(request);
        if (m_Traffic->m_WantsEnd) Wake();  // perhaps nothing else was under way
    }
    Recycle();
    return std::unique_ptr<Request>(request);
}

// State

bool RemoteApp::Connected() const {
    AutoAppLock guard(m_Lock);
    return m_Traffic->m_IsRunning;
}
Platform::_Socket* RemoteApp::GetSocket() const {
    AutoAppLock guard(m_Lock);
    return m_Traffic->m_Socket;
}
unsigned int RemoteApp::GetIPAddress() const {
    AutoAppLock guard(m_Lock);
    return m_IP;
}
OxStringT<char> RemoteApp::GetName() const {
    AutoAppLock guard(m_Lock);
    return m_Name;
}
OxStringT<char> RemoteApp::GetHostName() const {
    AutoAppLock guard(m_Lock);
    return m_HostName;
}
ScriptVal RemoteApp::GetUUID() const {
    AutoAppLock guard(m_Lock);
    return m_UUID;
}
bool RemoteApp::IsUUID(const ScriptVal& uuid) const {
    AutoAppLock guard(m_Lock);
    return uuid.IsString() && m_UUID == uuid;
}
bool RemoteApp::ClearUUID() {
    AutoAppLock guard(m_Lock);
    if (m_Traffic->m_IsRunning) return false;
    m_UUID = SV_Nil;
    return true;
}

void RemoteApp::SetConnectionInfo(ScriptVal& args) {
    OxStringT<char> name = CutName(args.FindKeyConst(1).ToString("unknown"));
    OxStringT<char> uuid = CutName(args.FindKeyConst(2).ToString(""));
    AutoAppLock guard(m_Lock);
    m_Name = name;
    m_UUID = static_cast<const char*>(uuid);
}

void RemoteApp::SetPeer(const char* name, const char* hostName, unsigned int ip,
                        const ScriptVal& uuid, const char* subtype) {
    AutoAppLock guard(m_Lock);
    m_Name = CutName(name);
    m_Subtype = CutName(subtype);
    m_HostName = CutName(hostName);
    m_IP = ip;
    m_UUID = uuid;
}

double RemoteApp::SetTimeOut(double seconds) {
    AutoAppLock guard(m_Lock);
    return std::exchange(m_TimeOut, seconds > 0 ? seconds : 0);
}
double RemoteApp::GetTimeOut() const {
    AutoAppLock guard(m_Lock);
    return m_TimeOut;
}

void RemoteApp::SetLastError(uint32_t number, const char* text) {
    AutoAppLock guard(m_Lock);
    m_LastError = number;
    m_LastErrorText = text;
}
uint32_t RemoteApp::TakeLastError(OxStringT<char>& text) {
    AutoAppLock guard(m_Lock);
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
        AutoAppLock guard(m_Lock);
        std::swap(m_StateData, replaced);
    }
    Packet* packet = CreatePkt(PKT_SetStateData, this, nullptr, &data);
    if (!packet) return SetLastError(SCERR_Unknown, kTooLarge);
    if (!DoPktAsync(packet, nullptr, nullptr)) FreePkt(packet);
}

// Ending

void RemoteApp::Close(const char* why, uint32_t run) {
    {
        AutoAppLock guard(m_Lock);
        if (run && run != m_Traffic->m_Run) return;
        if (!m_Traffic->m_WhyClosed) m_Traffic->m_WhyClosed = why;
    }
    Wake();
}

int RemoteApp::WriteData(void* data, int length) {
    return Platform::SocketSend(m_Traffic->m_Socket, data, length);
}
int RemoteApp::ReadData(void* data, int length) {
    return Platform::SocketReceive(m_Traffic->m_Socket, data, length, nullptr, nullptr);
}

}  // namespace Korvel

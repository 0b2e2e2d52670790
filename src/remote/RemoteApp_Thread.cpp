// The thread of a connection: it reads, writes, serves and wakes those who wait, until the peer has
// closed or it is told to end. It holds no lock while it does any of that; the lock guards the
// queues and tables for the moment of a look.
#include <sched.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <utility>

#include "Platform/Events.h"
#include "Platform/Networking.h"
#include "Platform/NoKillInternal.h"
#include "Platform/Threads.h"
#include "core/0ReusePool.h"
#include "remote/RemoteApp.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr unsigned int kSocketEvents = Platform::SE_READ | Platform::SE_CLOSE;
constexpr unsigned int kMaxSleepMs = 1000;
constexpr int64_t kMaxDelayMs = 10000;
constexpr int64_t kQuitLimitNs = 1000 * kNsPerMs;  // that the peer has after our end of sending
constexpr int kReadsInARow = 16;                   // before writing has its turn
constexpr uint32_t kFirstCapacity = 262144;        // of a large packet that has only begun

std::atomic<unsigned int> s_NumConnections{0};

}  // namespace

unsigned int GetNumConnections() {
    return s_NumConnections;
}

// Connecting

bool RemoteApp::Connect(Platform::_Socket* socket) {
    _Disconnect(Platform::kNoTimeLimit);
    CleanUpReferences();
    Platform::SetSocketNonBlocking(socket, true);
    Platform::SetSocketNoDelay(socket, true);
    KorvelScript::AutoLock guard(m_Lock);
    m_Traffic->m_Socket = socket;
    if (StartThread()) return true;
    m_Traffic->m_Socket = nullptr;
    Platform::DeleteSocket(socket);
    return false;
}

bool RemoteApp::Join(RemoteApp* a, RemoteApp* b) {
    if (!a || !b || a == b || a->Connected() || b->Connected()) return false;
    for (auto [self, peer] : {std::pair(a, b), std::pair(b, a)}) {
        KorvelScript::AutoLock guard(self->m_Lock);
        peer->Use();
        self->m_Traffic->m_Peer = peer;
        self->m_Traffic->m_Socket = kInProcess;
    }
    bool isStarted = true;
    for (RemoteApp* app : {a, b}) {
        KorvelScript::AutoLock guard(app->m_Lock);
        isStarted = isStarted && app->StartThread();
    }
    if (isStarted) return true;
    // TODO(remote): one of the two threads may run; it ends with its peer.
    a->_Disconnect(0);
    return false;
}

// Under the lock.
bool RemoteApp::StartThread() {
    Traffic& traffic = *m_Traffic;
    if (traffic.m_Thread) {  // of a run that has ended
        Platform::DeleteThread(std::exchange(traffic.m_Thread, nullptr));
    }
    Platform::DeleteSocketSet(traffic.m_Set);
    traffic.m_Set = Platform::NewSocketSet(3);
    if (!traffic.m_Set) return false;
    traffic.m_WakeEvent = static_cast<unsigned int>(Platform::AddSocketSet(traffic.m_Set, 0, 0));
    traffic.m_SocketEntry = 0;
    if (traffic.m_Socket != kInProcess) {
        traffic.m_SocketEntry = static_cast<int>(
            Platform::AddSocketSet(traffic.m_Set, traffic.m_Socket, kSocketEvents));
        if (!traffic.m_Input)
            traffic.m_Input =
                static_cast<unsigned char*>(g_ReusePoolMgr.Alloc(Traffic::kInputSize));
        if (!traffic.m_Input || !traffic.m_SocketEntry) return false;
    }
    traffic.m_MustQuit = traffic.m_MustClose = traffic.m_WantsEnd = false;
    traffic.m_QuitLimitNs = traffic.m_HeldUntilNs = 0;
    traffic.m_NumInput = traffic.m_NumWritten = traffic.m_NumRead = traffic.m_NumUnanswered = 0;
    Use();
    auto start = [](void* app) -> unsigned long long {
        Platform::SetThreadName("RemoteApp", nullptr);
        static_cast<RemoteApp*>(app)->AppThreadFunc();
        static_cast<RemoteApp*>(app)->Recycle();
        return 0;
    };
    unsigned long long id;
    traffic.m_Thread = Platform::NewThread(start, this, 0, &id);
    if (!traffic.m_Thread) {
        Recycle();
        return false;
    }
    traffic.m_IsRunning = true;
    s_NumConnections++;
    return true;
}

void RemoteApp::AppThreadFunc() {
    m_Traffic->m_ThreadID = Platform::GetCurrentThreadID();
    { KorvelScript::AutoLock wait(m_Lock); }  // until the start is complete
    HoldRoot();
    do {
        Sleep();
    } while (Serve());
    CloseDown();
}

// Waiting for something to do

unsigned int RemoteApp::GetSleepMs() {
    int64_t now = NowNs();
    int64_t limit = now + kMaxSleepMs * kNsPerMs;
    Traffic& traffic = *m_Traffic;
    if (traffic.m_QuitLimitNs) limit = std::min(limit, traffic.m_QuitLimitNs);
    RemoteApp* writer = this;
    {
        KorvelScript::AutoLock guard(m_Lock);
        limit = std::min(limit, traffic.m_NextDeadlineNs);
        if (traffic.m_Peer) writer = traffic.m_Peer;
    }
    {
        KorvelScript::AutoLock guard(writer->m_Lock);
        if (writer->m_Traffic->m_HeldUntilNs) {
            limit = std::min(limit, writer->m_Traffic->m_HeldUntilNs);
        }
    }
    // Rounded up, or a thread that is early looks again and again.
    return limit > now ? static_cast<unsigned int>((limit - now + kNsPerMs - 1) / kNsPerMs) : 0;
}

// Returns when there may be something to do.
void RemoteApp::Sleep() {
    Traffic& traffic = *m_Traffic;
    if (int64_t budget = traffic.m_Look.GetBudgetNs()) {
        int64_t limit = NowNs() + budget;
        bool found;
        while (!(found = traffic.m_HasWork.exchange(false) ||
                         (traffic.m_SocketEntry && Platform::WaitSocketSet(traffic.m_Set, 0))) &&
               NowNs() < limit) {
            sched_yield();
        }
        traffic.m_Look.Note(found);
        if (found) return;
    }
    traffic.m_IsAsleep = true;
    // From here on whoever brings work wakes us.
    if (!traffic.m_HasWork) Platform::WaitSocketSet(traffic.m_Set, GetSleepMs());
    traffic.m_IsAsleep = false;
    traffic.m_HasWork = false;
}

// One round; false at the end of the connection.
bool RemoteApp::Serve() {
    Traffic& traffic = *m_Traffic;
    if (traffic.m_MustQuit && !traffic.m_QuitLimitNs) {
        if (!traffic.m_SocketEntry) return false;
        Platform::ShutdownSocket(traffic.m_Socket, 2);
        traffic.m_QuitLimitNs = NowNs() + kQuitLimitNs;
    }
    if (traffic.m_QuitLimitNs && NowNs() >= traffic.m_QuitLimitNs) return false;
    bool isOpen = true;
    if (traffic.m_SocketEntry) {
        // A wake-up hides what the socket has to say, and an error has no event of its own: so
        // there is always a look.
        DoWrite();
        isOpen = ReadSocket();
        DoWrite();
    } else {
        ReadPeer();
        KorvelScript::AutoLock guard(m_Lock);
        isOpen = traffic.m_Peer != nullptr;
    }
    EndOverdue();
    return isOpen && !traffic.m_MustClose && !IsIdle();
}

// Disconnect has been called, and nothing is under way.
bool RemoteApp::IsIdle() {
    KorvelScript::AutoLock guard(m_Lock);
    const Traffic& traffic = *m_Traffic;
    return traffic.m_WantsEnd && !traffic.m_Requests.GetCount() && !traffic.m_NumUnanswered &&
           traffic.m_Outgoing.IsEmpty() && !traffic.m_Writing;
}

// Writing

// The first packet whose time has come; else null, and how long it takes.
Packet* RemoteApp::TakeOutgoing() {
    Platform::NoKill noKill;
    KorvelScript::AutoLock guard(m_Lock);
    Traffic& traffic = *m_Traffic;
    Packet* first = traffic.m_Outgoing.First();
    if (!first) return nullptr;
    if (first->m_Delay) {
        int64_t now = NowNs();
        if (!traffic.m_HeldUntilNs) {
            int64_t delayMs = std::min<int64_t>(first->m_Delay, kMaxDelayMs);
            traffic.m_HeldUntilNs = now + delayMs * kNsPerMs;
        }
        if (now < traffic.m_HeldUntilNs) return nullptr;
        traffic.m_HeldUntilNs = 0;
    }
    return traffic.m_Outgoing.Take();
}

void RemoteApp::DoWrite() {
    Traffic& traffic = *m_Traffic;
    while (traffic.m_Writing || (traffic.m_Writing = TakeOutgoing())) {
        uint32_t left = traffic.m_Writing->m_Size - traffic.m_NumWritten;
        int written = WriteData(reinterpret_cast<char*>(traffic.m_Writing) + traffic.m_NumWritten,
                                static_cast<int>(std::min<uint32_t>(left, INT_MAX)));
        if (written <= 0) break;
        traffic.m_NumWritten += static_cast<uint32_t>(written);
        if (traffic.m_NumWritten < traffic.m_Writing->m_Size) break;
        FreePkt(std::exchange(traffic.m_Writing, nullptr));
        traffic.m_NumWritten = 0;
    }
    // An error shows when reading.
    unsigned int events = kSocketEvents;
    if (traffic.m_Writing) events |= Platform::SE_WRITE;
    Platform::ModifySocketSetEvents(traffic.m_Set, traffic.m_SocketEntry, events);
}

// Reading

void RemoteApp::DoRead() {
    if (m_Traffic->m_SocketEntry) {
        ReadSocket();
    } else {
        ReadPeer();
    }
}

// Takes what has arrived; false when the connection has ended, and all that came before the end has
// been served.
bool RemoteApp::ReadSocket() {
    Traffic& traffic = *m_Traffic;
    for (int i = 0; i < kReadsInARow && !traffic.m_MustClose; i++) {
        bool isLarge = traffic.m_Reading != nullptr;
        unsigned char* place = traffic.m_Input + traffic.m_NumInput;
        uint32_t room = Traffic::kInputSize - traffic.m_NumInput;
        if (isLarge) {
            place = reinterpret_cast<unsigned char*>(traffic.m_Reading) + traffic.m_NumRead;
            room = traffic.m_Capacity - traffic.m_NumRead;
        }
        errno = 0;  // an orderly end sets none
        int received = ReadData(place, static_cast<int>(room));
        if (received <= 0) return Platform::GetSocketError() == Platform::SERR_WOULDBLOCK;
        (isLarge ? traffic.m_NumRead : traffic.m_NumInput) += static_cast<uint32_t>(received);
        if (!(isLarge ? FinishReading() : TakeInput())) return false;
        if (static_cast<uint32_t>(received) < room) return true;  // there was no more
    }
    return true;
}

// Serves the packets in the input buffer; false when the stream is broken.
bool RemoteApp::TakeInput() {
    Traffic& traffic = *m_Traffic;
    uint32_t used = 0;
    while (!traffic.m_MustClose && !traffic.m_Reading) {
        uint32_t left = traffic.m_NumInput - used;
        uint32_t size;
        if (left < sizeof(size)) break;
        const unsigned char* bytes = traffic.m_Input + used;
        memcpy(&size, bytes, sizeof(size));
        if (size < kMinPacketSize || size > GetMaxPacketSize()) {
            Close("the peer sent a packet of an impossible size");
            return false;
        }
        if (size > Traffic::kInputSize) {
            // Memory grows with the bytes that have arrived, not with what is claimed.
            traffic.m_Capacity = std::min(size, kFirstCapacity);
            traffic.m_Reading = AllocPkt(traffic.m_Capacity);
            if (!traffic.m_Reading) {
                Close("there is no memory for a packet");
                return false;
            }
            memcpy(static_cast<void*>(traffic.m_Reading), bytes, left);
            traffic.m_NumRead = left;
            used += left;
        } else if (left < size) {
            break;
        } else {
            Packet* packet = AllocPkt(size);
            if (!packet) {
                Close("there is no memory for a packet");
                return false;
            }
            memcpy(static_cast<void*>(packet), bytes, size);
            used += size;
            DispatchPacket(packet);
        }
    }
    traffic.m_NumInput -= used;
    memmove(traffic.m_Input, traffic.m_Input + used, traffic.m_NumInput);
    return true;
}

// Serves the large packet when it is complete, or makes room for more of it.
bool RemoteApp::FinishReading() {
    Traffic& traffic = *m_Traffic;
    if (traffic.m_NumRead < traffic.m_Capacity) return true;
    uint32_t size = traffic.m_Reading->m_Size;
    if (traffic.m_NumRead == size) {
        DispatchPacket(std::exchange(traffic.m_Reading, nullptr));
        return true;
    }
    uint32_t capacity =
        static_cast<uint32_t>(std::min<uint64_t>(size, uint64_t{traffic.m_Capacity} * 2));
    Packet* larger = AllocPkt(capacity);
    if (!larger) {
        Close("there is no memory for a packet");
        return false;
    }
    memcpy(static_cast<void*>(larger), traffic.m_Reading, traffic.m_NumRead);
    FreePkt(std::exchange(traffic.m_Reading, larger));
    traffic.m_Capacity = capacity;
    return true;
}

// Within the process, packets come from the peer's own queue.
void RemoteApp::ReadPeer() {
    RemoteApp* peer = m_Traffic->m_Peer;  // only this thread writes it
    if (!peer) return;
    while (Packet* packet = peer->TakeOutgoing()) DispatchPacket(packet);
}

// Ending

// Asynchronous requests whose time has passed.
void RemoteApp::EndOverdue() {
    int64_t now = NowNs();
    Request* overdue;
    {
        KorvelScript::AutoLock guard(m_Lock);
        Traffic& traffic = *m_Traffic;
        if (now < traffic.m_NextDeadlineNs) return;
        traffic.m_NextDeadlineNs = INT64_MAX;
        overdue = traffic.m_Requests.TakeIf([&](Request& request) {
            if (!request.m_DeadlineNs) return false;
            if (request.m_DeadlineNs <= now) return true;
            traffic.m_NextDeadlineNs = std::min(traffic.m_NextDeadlineNs, request.m_DeadlineNs);
            return false;
        });
    }
    DropRequests(overdue);
}

// Tells the callbacks of requests that there will be no reply.
void RemoteApp::DropRequests(Request* requests) {
    while (Request* request = requests) {
        requests = request->m_Next;
        if (request->m_Callback) {
            request->m_Callback(request->m_Data, this, nullptr, request->m_Context);
        }
        if (request->m_Reply) DropPkt(this, request->m_Reply);
        delete request;
    }
}

void RemoteApp::CloseDown() {
    Traffic& traffic = *m_Traffic;
    Platform::_Socket* socket;
    RemoteApp* peer;
    Request* requests;
    {
        KorvelScript::AutoLock guard(m_Lock);
        traffic.m_IsRunning = false;
        socket = std::exchange(traffic.m_Socket, nullptr);
        peer = std::exchange(traffic.m_Peer, nullptr);
        requests = traffic.m_Requests.TakeIf([](Request& request) {
            if (!request.m_HasWaiter) return true;
            request.m_IsOver = true;
            request.m_Event.Signal();
            return false;
        });
        while (Packet* packet = traffic.m_Outgoing.Take()) FreePkt(packet);
    }
    s_NumConnections--;
    if (socket != kInProcess) Platform::DeleteSocket(socket);
    if (peer) {
        peer->m_Traffic->m_MustQuit = true;
        peer->Wake();
        peer->Recycle();
    }
    FreePkt(std::exchange(traffic.m_Writing, nullptr));
    FreePkt(std::exchange(traffic.m_Reading, nullptr));
    DropRequests(requests);
    CleanUpReferences();
}

}  // namespace Korvel

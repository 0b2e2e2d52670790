// The thread of a connection: it reads, writes, serves and wakes those who wait, until the peer has
// closed or it is told to end. It holds no lock while it does any of that; the lock guards the
// queues and tables for the moment of a look.
#include <algorithm>
#include <climits>
#include <cstring>
#include <utility>

#include "Platform/Networking.h"
#include "Platform/NetworkingInternal.h"
#include "core/0ReusePool.h"
#include "diag/Env.h"
#include "remote/RemoteApp.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr unsigned int kSocketEvents = Platform::SE_READ | Platform::SE_CLOSE;
constexpr unsigned int kMaxSleepMs = 1000;
constexpr int64_t kMaxDelayMs = 10000;
constexpr int64_t kQuitLimitNs = 1000 * kNsPerMs;  // from _Disconnect on
constexpr int kStepsInARow = 16;                   // before something else has its turn
constexpr uint32_t kFirstCapacity = 262144;        // of a large packet that has only begun
constexpr uint32_t kMostThreshold = 131072;        // of bytes to wait for
constexpr int64_t kCheckNs = 1000 * kNsPerMs;      // between looks at how the peer does

EnvInt s_StalledQueueSize("KORVEL_StalledQueueSize", true, 64);  // in MiB
EnvInt s_StallSeconds("KORVEL_StallSeconds", true, 60);

constexpr char kNoMemoryForPacket[] = "there is no memory for a packet";

}  // namespace

// Waiting for something to do

unsigned int RemoteApp::GetSleepMs() {
    int64_t now = NowNs();
    int64_t limit = now + kMaxSleepMs * kNsPerMs;
    Traffic& traffic = *m_Traffic;
    if (traffic.m_QuitLimitNs) limit = std::min(limit, traffic.m_QuitLimitNs);
    RemoteApp* writer = this;
    {
        AutoAppLock guard(m_Lock);
        limit = std::min(limit, traffic.m_NextDeadlineNs);
        if (traffic.m_Peer) writer = traffic.m_Peer;
    }
    {
        AutoAppLock guard(writer->m_Lock);
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
    auto find = [&] {
        return traffic.m_HasWork.exchange(false) ||
               (traffic.m_SocketEntry && Platform::WaitSocketSet(traffic.m_Set, 0) > 0);
    };
    if (traffic.m_Look.Look(find)) return;
    traffic.m_IsAsleep = true;
    // From here on whoever brings work wakes us.
    if (!traffic.m_HasWork && Platform::WaitSocketSet(traffic.m_Set, GetSleepMs()) < 0) {
        Close("the system does not wait for it");
    }
    traffic.m_IsAsleep = false;
    traffic.m_HasWork = false;
}

// One round; false at the end of the connection.
bool RemoteApp::Serve() {
    Traffic& traffic = *m_Traffic;
    int64_t now = NowNs();
    if (traffic.m_MustQuit && !traffic.m_QuitLimitNs) {
        if (!traffic.m_SocketEntry) return false;
        traffic.m_QuitLimitNs = now + kQuitLimitNs;
    }
    if (traffic.m_QuitLimitNs && now >= traffic.m_QuitLimitNs) return false;
    if (traffic.m_SocketEntry) {
        // A wake-up hides what the socket has to say, and an error has no event of its own: so
        // there is always a look.
        DoWrite();
        if (traffic.m_QuitLimitNs) StopSending();
        DoRead();
        DoWrite();
    } else {
        DoRead();
    }
    EndOverdue(now);
    if (traffic.m_SocketEntry && now >= traffic.m_NextCheckNs) CheckPeer(now);
    return !traffic.m_HasEnded && !traffic.m_WhyClosed && !IsIdle();
}

// When what was to be sent has been, or has a delay: the peer then sees the end.
void RemoteApp::StopSending() {
    Traffic& traffic = *m_Traffic;
    if (traffic.m_IsShut || traffic.m_Writing) return;
    Platform::ShutdownSocket(traffic.m_Socket, 2);
    traffic.m_IsShut = true;
}

// Disconnect has been called, and nothing is under way.
bool RemoteApp::IsIdle() const {
    AutoAppLock guard(m_Lock);
    const Traffic& traffic = *m_Traffic;
    // One that has been refused need not answer.
    bool isAnswered =
        traffic.m_IsRefused || (!traffic.m_Requests.GetCount() && !traffic.m_NumSilent);
    return traffic.m_WantsEnd && isAnswered && !traffic.m_NumUnanswered &&
           traffic.m_Outgoing.IsEmpty() && !traffic.m_Writing;
}

// Writing

Packet* RemoteApp::GetNextSendPacket() {
    return TakeFor(nullptr, true);
}

// The first packet whose time has come; else null, and it is noted how long that takes. It is for
// the peer within the process, or for a socket; where it may not wait, for one without a delay.
Packet* RemoteApp::TakeFor(const RemoteApp* peer, bool mayWait) {
    AutoAppLock guard(m_Lock);
    Traffic& traffic = *m_Traffic;
    Packet* first = traffic.m_Outgoing.First();
    if (!first || traffic.m_Peer != peer) return nullptr;
    if (first->m_Delay) {
        if (!mayWait) return nullptr;
        int64_t now = NowNs();
        if (!traffic.m_HeldUntilNs) {
            int64_t delayMs = std::min<int64_t>(first->m_Delay, kMaxDelayMs);
            traffic.m_HeldUntilNs = now + delayMs * kNsPerMs;
        }
        if (now < traffic.m_HeldUntilNs) return nullptr;
        traffic.m_HeldUntilNs = 0;
    }
    traffic.m_Outgoing.Take();
    if (peer && traffic.m_WantsEnd && traffic.m_Outgoing.IsEmpty()) Wake();
    return first;
}

// A packet with another one behind it waits in the system for that, so that both travel together.
void RemoteApp::DoWrite() {
    Traffic& traffic = *m_Traffic;
    for (int i = 0; !traffic.m_IsShut; i++) {
        if (!traffic.m_Writing) traffic.m_Writing = GetNextSendPacket();
        if (!traffic.m_Writing) break;
        if (i == kStepsInARow) {
            traffic.m_HasWork = true;
            break;
        }
        if (!traffic.m_Following) traffic.m_Following = TakeFor(nullptr, false);
        if (!WriteSome()) break;
    }
    // An error shows when reading. Once it is shut, a socket is ready for writing all the time.
    unsigned int events = kSocketEvents;
    if (traffic.m_Writing && !traffic.m_IsShut) events |= Platform::SE_WRITE;
    Platform::ModifySocketSetEvents(traffic.m_Set, traffic.m_SocketEntry, events);
}

// Of the packet that is being written; false when the socket takes no more.
bool RemoteApp::WriteSome() {
    Traffic& traffic = *m_Traffic;
    char* rest = reinterpret_cast<char*>(traffic.m_Writing) + traffic.m_NumWritten;
    int left = static_cast<int>(traffic.m_Writing->m_Size - traffic.m_NumWritten);
    int written = traffic.m_Following
                      ? static_cast<int>(Platform::SocketSendMore(traffic.m_Socket, rest, left))
                      : WriteData(rest, left);
    if (written <= 0) return false;
    traffic.m_HasWritten = true;
    traffic.m_NumWritten += static_cast<uint32_t>(written);
    if (written < left) return false;
    FreePkt(std::exchange(traffic.m_Writing, std::exchange(traffic.m_Following, nullptr)));
    traffic.m_NumWritten = 0;
    return true;
}

// Reading

void RemoteApp::DoRead() {
    bool isOpen = m_Traffic->m_SocketEntry ? ReadSocket() : ReadPeer();
    if (!isOpen) m_Traffic->m_HasEnded = true;
}

// Takes what has arrived; false when the connection has ended, and all that came before the end has
// been served.
bool RemoteApp::ReadSocket() {
    Traffic& traffic = *m_Traffic;
    if (traffic.m_HasInput && !TakeInput()) return false;
    for (int i = 0; i < kStepsInARow && !traffic.m_HasInput && !traffic.m_WhyClosed; i++) {
        bool isLarge = traffic.m_Reading != nullptr;
        unsigned char* place = traffic.m_Input + traffic.m_NumInput;
        uint32_t room = Traffic::kInputSize - traffic.m_NumInput;
        if (isLarge) {
            place = reinterpret_cast<unsigned char*>(traffic.m_Reading) + traffic.m_NumRead;
            room = traffic.m_Capacity - traffic.m_NumRead;
        }
        int received = ReadData(place, static_cast<int>(room));
        if (received <= 0) return Platform::GetSocketError() == Platform::SERR_WOULDBLOCK;
        (isLarge ? traffic.m_NumRead : traffic.m_NumInput) += static_cast<uint32_t>(received);
        if (!(isLarge ? FinishReading() : TakeInput())) return false;
        if (isLarge || traffic.m_Reading) SetThreshold();
        if (static_cast<uint32_t>(received) < room) break;  // there was no more
    }
    if (traffic.m_HasInput) traffic.m_HasWork = true;  // when others have had their turn
    return true;
}

// Of a large packet, many bytes are worth a wake-up.
void RemoteApp::SetThreshold() {
    Traffic& traffic = *m_Traffic;
    uint32_t left = traffic.m_Reading ? traffic.m_Reading->m_Size - traffic.m_NumRead : 1;
    int threshold = static_cast<int>(std::min(left, kMostThreshold));
    if (threshold == traffic.m_Threshold) return;
    if (Platform::SetSocketReadThreshold(traffic.m_Socket, threshold)) {
        traffic.m_Threshold = threshold;
    }
}

// Serves the packets in the input buffer, some of them at a time; false when the stream is broken.
bool RemoteApp::TakeInput() {
    Traffic& traffic = *m_Traffic;
    for (int i = 0;; i++) {
        uint32_t left = traffic.m_NumInput - traffic.m_NumUsed;
        const unsigned char* bytes = traffic.m_Input + traffic.m_NumUsed;
        uint32_t size;
        traffic.m_HasInput = left >= sizeof(size);
        if (!traffic.m_HasInput) break;
        memcpy(&size, bytes, sizeof(size));
        if (size < kMinPacketSize || size > GetMaxPacketSize()) {
            Close("the peer sent a packet of an impossible size");
            return false;
        }
        traffic.m_HasInput = left >= size;
        if (size > Traffic::kInputSize) {
            if (!BeginLarge(size, bytes, left)) return false;
            break;
        }
        if (!traffic.m_HasInput) break;
        bool mustQuit = traffic.m_MustQuit && !traffic.m_QuitLimitNs;
        if (i == kStepsInARow || mustQuit || traffic.m_WhyClosed) return true;
        Packet* packet = AllocPkt(size);
        if (!packet) {
            Close(kNoMemoryForPacket);
            return false;
        }
        memcpy(static_cast<void*>(packet), bytes, size);
        traffic.m_NumUsed += size;
        DispatchPacket(packet);
    }
    traffic.m_NumInput -= traffic.m_NumUsed;
    memmove(traffic.m_Input, traffic.m_Input + traffic.m_NumUsed, traffic.m_NumInput);
    traffic.m_NumUsed = 0;
    return true;
}

// Moves the beginning of a large packet to where the rest will go. Memory grows with the bytes that
// have arrived, not with what is claimed.
bool RemoteApp::BeginLarge(uint32_t size, const unsigned char* bytes, uint32_t length) {
    Traffic& traffic = *m_Traffic;
    traffic.m_Capacity = std::min(size, kFirstCapacity);
    traffic.m_Reading = AllocPkt(traffic.m_Capacity);
    if (!traffic.m_Reading) {
        Close(kNoMemoryForPacket);
        return false;
    }
    memcpy(static_cast<void*>(traffic.m_Reading), bytes, length);
    traffic.m_NumRead = length;
    traffic.m_NumUsed += length;
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
        static_cast<uint32_t>(std::min<uint64_t>(size, uint64_t{traffic.m_Capacity} * 4));
    Packet* larger = AllocPkt(capacity);
    if (!larger) {
        Close(kNoMemoryForPacket);
        return false;
    }
    memcpy(static_cast<void*>(larger), traffic.m_Reading, traffic.m_NumRead);
    FreePkt(std::exchange(traffic.m_Reading, larger));
    traffic.m_Capacity = capacity;
    return true;
}

// Within the process, packets come from the peer's own queue.
bool RemoteApp::ReadPeer() {
    Traffic& traffic = *m_Traffic;
    RemoteApp* peer = traffic.m_Peer;  // fixed while it runs
    for (int i = 0; i < kStepsInARow && !traffic.m_WhyClosed && !traffic.m_MustQuit; i++) {
        Packet* packet = peer->TakeFor(this, true);
        if (!packet) return true;
        DispatchPacket(packet);
    }
    traffic.m_HasWork = true;
    return true;
}

// Ending

// Asynchronous requests whose time has passed.
void RemoteApp::EndOverdue(int64_t now) {
    Request* overdue;
    {
        AutoAppLock guard(m_Lock);
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

// Ends the connection when the peer has vanished, or does not take what waits for it.
void RemoteApp::CheckPeer(int64_t now) {
    Traffic& traffic = *m_Traffic;
    traffic.m_NextCheckNs = now + kCheckNs;

    uint64_t queued;
    {
        AutoAppLock guard(m_Lock);
        queued = traffic.m_Outgoing.GetBytes();
    }
    if (traffic.m_Writing) queued += traffic.m_Writing->m_Size;
    bool isLong = queued > static_cast<uint64_t>(s_StalledQueueSize) << 20;
    if (std::exchange(traffic.m_HasWritten, false) || !isLong) traffic.m_ProgressNs = now;
    if (now - traffic.m_ProgressNs > s_StallSeconds * 1000 * kNsPerMs) {
        Close("the peer takes nothing of what waits for it");
    }

    Platform::SocketSilence silence;
    bool isOwed = Platform::GetSocketSilence(traffic.m_Socket, silence) && silence.m_IsOwed;
    if (!isOwed) {
        traffic.m_OwedSinceNs = 0;
        return;
    }
    if (!traffic.m_OwedSinceNs) traffic.m_OwedSinceNs = now;
    PeerTimeout timeout;
    if (silence.m_Ms >= timeout.SilenceMs() &&
        now - traffic.m_OwedSinceNs >= timeout.AskEvery() * 1000 * kNsPerMs) {
        Close("the peer has vanished");
    }
}

// Tells the callbacks of requests that there will be no reply.
void RemoteApp::DropRequests(Request* requests) {
    while (Request* request = requests) {
        requests = request->m_Next;
        if (request->m_Callback) {
            request->m_Callback(request->m_Data, this, nullptr, request->m_Context);
        }
        FreePkt(request->m_Reply);  // its run is over, or it never came
        delete request;
    }
}

}  // namespace Korvel

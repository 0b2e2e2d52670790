#pragma once

#include <algorithm>
#include <atomic>
#include <cstdint>

#include "Platform/FutexInternal.h"
#include "Platform/Lock.h"
#include "Platform/NoKillInternal.h"
#include "core/0ReusePool.h"
#include "core/SpinLockInternal.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"

namespace Korvel {

// Nanoseconds of a clock that nobody sets.
int64_t NowNs();
constexpr int64_t kNsPerMs = 1000000;

// The moment that lies so many seconds ahead; 0, which is never, for 0 and for what is too far.
int64_t DeadlineAfter(double seconds);

// The bytes that may wait to be sent on a connection.
uint64_t GetMaxQueueSize();

constexpr uint32_t kRootID = 1;         // of the application's object
constexpr uint32_t kNoID = UINT32_MAX;  // on the wire: an object that cannot be named

constexpr char kTooLarge[] = "Packet too large.";  // for a caller
constexpr char kNoValues[] = "the peer sent a packet with no valid values";
// Somebody waits for it, and would go on waiting.
constexpr char kNoMemoryForReply[] = "there is no memory for a reply";

// Holds a connection's lock.
class AutoAppLock {
public:
    explicit AutoAppLock(KorvelScript::Lock& lock) : m_Lock(lock) {}

private:
    Platform::NoKill m_NoKill;
    LockPlace m_Place{LockRank::Connection};
    KorvelScript::AutoLock m_Lock;
};

// Looks for something again and again before its thread goes to sleep for it, as long as that pays:
// a thread that is woken on an idle processor loses far more time than one that looks a little
// longer. It gives way to other threads meanwhile. After times that found nothing, and where others
// need the processor, it only tries now and then.
class LookAgain {
public:
    // False when it has not been found, or when it does not pay to look.
    template <class Find>
    bool Look(Find&& find) {
        int64_t last = Begin();
        if (last >= m_LimitNs) return false;
        while (!find()) {
            if (last >= m_LimitNs) {
                m_Credit = std::max(m_Credit - 1, 0);
                return false;
            }
            last = GiveWay(last);
        }
        m_Credit = std::min(m_Credit + 1, kMostCredit);
        return true;
    }

private:
    static constexpr int kMostCredit = 8;

    int64_t Begin();
    int64_t GiveWay(int64_t last);

    int64_t m_LimitNs = 0;
    int m_Credit = kMostCredit / 2;
    unsigned m_Skipped = 0;
};

// A thread that waits for something of a connection: a reply, or the end.
class Waiter {
public:
    // Until it is over, or the deadline has come; 0 is none.
    void Wait(int64_t deadlineNs);
    bool IsOver() const { return m_State.load(std::memory_order_acquire) == kOver; }

    // Ends the wait in two steps, the second for after the locks. The waiter may be gone by then.
    [[nodiscard]] bool EndQuietly() { return m_State.exchange(kOver) == kAsleep; }
    static void WakeUp(const Waiter* waiter) { Platform::FutexWake(&waiter->m_State, 1); }
    void End() {
        if (EndQuietly()) WakeUp(this);
    }

    bool m_IsFromUI = false;  // fixed before others see it

private:
    enum : uint32_t { kAwake, kAsleep, kOver };
    Platform::FutexWord m_State{kAwake};
};

// A request that has been sent, until its reply has been taken or given up.
struct Request : Reuser {
    uint32_t m_Context = 0;
    uint16_t m_Run = 0;         // of the connection
    Request* m_Next = nullptr;  // in its bucket
    bool m_IsInTable = false;

    // Guarded by the connection's lock
    Packet* m_Reply = nullptr;
    AsyncCallback m_Callback = nullptr;
    void* m_Data = nullptr;
    bool m_IsAsync = false;      // the reply goes to the callback, or nowhere
    bool m_WantsValues = false;  // rather than a packet, if they are here first
    bool m_HasValues = false;
    ScriptVal m_Values;
    bool m_HasWaiter = false;  // a thread that takes the request over by itself
    int64_t m_DeadlineNs = 0;  // of an asynchronous one; 0 for none

    Waiter m_Waiter;  // over when the reply is there, or there will be none
};

// Requests by number. Numbers are given out one after the other, so they spread over the buckets by
// themselves.
class RequestTable {
public:
    RequestTable() = default;
    RequestTable(const RequestTable&) = delete;
    RequestTable& operator=(const RequestTable&) = delete;
    ~RequestTable();

    bool Add(Request* request);  // false without memory
    Request* Find(uint32_t context) const;
    void Remove(Request* request);
    uint32_t GetCount() const { return m_Count; }

    template <class Visit>
    void ForEach(Visit&& visit) {
        for (uint32_t i = 0; i < m_Size; i++) {
            for (Request* request = m_Buckets[i]; request; request = request->m_Next) {
                visit(*request);
            }
        }
    }

    // Takes out what `which` is true for, as a chain through m_Next.
    template <class Which>
    Request* TakeIf(Which&& which) {
        Request* taken = nullptr;
        for (uint32_t i = 0; i < m_Size; i++) {
            for (Request** link = &m_Buckets[i]; Request* request = *link;) {
                if (!which(*request)) {
                    link = &request->m_Next;
                    continue;
                }
                *link = request->m_Next;
                request->m_Next = taken;
                request->m_IsInTable = false;
                taken = request;
                m_Count--;
            }
        }
        return taken;
    }

private:
    bool Grow();

    Request** m_Buckets = nullptr;
    uint32_t m_Size = 0;  // a power of two
    uint32_t m_Count = 0;
};

// Packets on their way, first in, first out.
class PacketQueue {
public:
    PacketQueue() = default;
    PacketQueue(const PacketQueue&) = delete;
    PacketQueue& operator=(const PacketQueue&) = delete;
    ~PacketQueue();  // frees what is left

    bool Add(Packet* packet);  // false without memory
    Packet* First() const { return m_First ? m_First->m_Packet : nullptr; }
    Packet* Take();  // null when there is none
    bool IsEmpty() const { return !m_First; }
    uint64_t GetBytes() const { return m_Bytes; }

private:
    struct Node : Reuser {
        explicit Node(Packet* packet) : m_Packet(packet) {}
        Packet* m_Packet;
        Node* m_Next = nullptr;
    };

    Node* m_First = nullptr;
    Node** m_Last = &m_First;
    uint64_t m_Bytes = 0;
};

// Packets that wait for the UI thread.
class UIBacklog {
public:
    explicit UIBacklog(uint32_t most) : m_Most(most) {}

    // False when there are too many; one is never too large.
    bool Add(uint32_t size) {
        uint32_t count = ++m_Count;
        uint64_t bytes = m_Bytes += size;
        if (count == 1 || (count <= m_Most && bytes <= kMostBytes)) return true;
        Remove(size);
        return false;
    }
    void Remove(uint32_t size) {
        m_Bytes -= size;
        m_Count--;
    }

private:
    static constexpr uint64_t kMostBytes = uint64_t{64} << 20;

    const uint32_t m_Most;
    std::atomic<uint32_t> m_Count{0};
    std::atomic<uint64_t> m_Bytes{0};
};

// A silent peer is asked after a third of its time, then every ninth. What it owes by then, its own
// system answers at once, so the end comes in time.
struct PeerTimeout {
    PeerTimeout();
    int AskAfter() const { return m_Seconds / 3; }
    int AskEvery() const { return std::max(m_Seconds / 9, 1); }
    unsigned int SilenceMs() const { return static_cast<unsigned int>(m_Seconds) * 1000 / 6 * 5; }
    static constexpr int kNumQuestions = 5;

private:
    const int m_Seconds;
};

struct EndWaiter : Reuser, Waiter {
    EndWaiter* m_Next = nullptr;
};

// What a connection sends, receives and waits for.
struct RemoteApp::Traffic {
    // Guarded by the connection's lock
    bool m_IsRunning = false;
    bool m_IsBeginning = false;                 // a thread makes it run
    bool m_IsConnecting = false;                // a thread connects it, by name or by address
    bool m_IsCancelled = false;                 // that shall end
    Platform::_SocketSet* m_CallSet = nullptr;  // on which that thread waits for the peer
    int m_CancelEvent = 0;                      // of that set
    RemoteApp* m_Server = nullptr;              // that it asks; the thread's
    uint16_t m_Run = 0;                         // which run it is, or was; not 0 once there was one
    bool m_HasThread = false;                   // which has not come to its very end
    EndWaiter* m_EndWaiters = nullptr;          // for that, a chain
    bool m_IsServing = false;                   // number 1 is counted for the peer
    bool m_WantsEnd = false;                    // Disconnect: when nothing is under way any more
    Platform::_Socket* m_Socket = nullptr;      // kInProcess within the process
    RemoteApp* m_Peer = nullptr;                // there; holds a use
    uint32_t m_LastContext = 0;
    RequestTable m_Requests;
    int64_t m_NextDeadlineNs = INT64_MAX;  // no asynchronous request is due earlier
    uint32_t m_NumSilent = 0;              // requests whose replies nobody wants
    uint32_t m_NumUnanswered = 0;
    bool m_IsReported = false;  // to the host
    PacketQueue m_Outgoing;
    int64_t m_HeldUntilNs = 0;  // the first one's delay; 0 when it has not begun

    // Waiting for the UI thread
    std::atomic<bool> m_IsWaitingForUI{false};  // the thread, in a member that has to run there
    UIBacklog m_CallsForUI{65536};
    UIBacklog m_ReleasesForUI{1 << 20};

    // Waking the thread. The set and its numbers are fixed while it runs, and go under the lock.
    Platform::_SocketSet* m_Set = nullptr;
    int m_WakeEvent = 0;
    int m_SocketEntry = 0;
    std::atomic<bool> m_HasWork{false};
    std::atomic<bool> m_IsAsleep{false};
    // Set under the lock, for the run that there is
    std::atomic<bool> m_IsRefused{false};  // nothing more is done for the peer
    std::atomic<bool> m_IsLoggedIn{true};  // the peer, or it need not
    std::atomic<PeerKind> m_PeerKind{PeerKind::Caller};
    std::atomic<bool> m_MustQuit{false};            // _Disconnect: end with the peer, or soon
    std::atomic<const char*> m_WhyClosed{nullptr};  // set to end at once

    // Connection thread
    Packet* m_Writing = nullptr;
    uint32_t m_NumWritten = 0;
    Packet* m_Following = nullptr;     // the one behind it
    unsigned char* m_Input = nullptr;  // kInputSize bytes, of which some begin a packet
    uint32_t m_NumInput = 0;
    uint32_t m_NumUsed = 0;       // of these, from the beginning
    bool m_HasInput = false;      // there may be a whole packet among the rest
    Packet* m_Reading = nullptr;  // too large for the input buffer
    uint32_t m_NumRead = 0;
    uint32_t m_Capacity = 0;  // of m_Reading
    int m_Threshold = 1;      // bytes that the socket has to have
    bool m_HasEnded = false;  // what the peer has to say
    int64_t m_QuitLimitNs = 0;
    bool m_IsShut = false;      // for sending
    int64_t m_NextCheckNs = 0;  // of the peer
    int64_t m_OwedSinceNs = 0;  // a sign of life; 0 when it owes none
    int64_t m_ProgressNs = 0;   // when the queue was last found short, or moving
    bool m_HasWritten = false;  // since then
    LookAgain m_Look;

    static constexpr uint32_t kInputSize = 65536;
};

}  // namespace Korvel

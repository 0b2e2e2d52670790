#pragma once

#include <atomic>
#include <cstdint>

#include "Platform/Event.h"
#include "core/0ReusePool.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"

namespace Korvel {

// Nanoseconds of a clock that nobody sets.
int64_t NowNs();
constexpr int64_t kNsPerMs = 1000000;

// A request that has been sent, until its reply has been taken or given up.
struct Request : Reuser {
    uint32_t m_Context = 0;
    Request* m_Next = nullptr;  // in its bucket

    // Guarded by the connection's lock
    Packet* m_Reply = nullptr;
    AsyncCallback m_Callback = nullptr;
    void* m_Data = nullptr;
    bool m_IsAsync = false;    // the reply goes to the callback, or nowhere
    bool m_HasWaiter = false;  // a thread that takes the request out by itself
    int64_t m_DeadlineNs = 0;  // of an asynchronous one; 0 for none

    // For the waiter
    std::atomic<bool> m_IsOver{false};  // the reply is there, or there will be none
    KorvelScript::Event m_Event;
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

// Whether it pays to look again before going to sleep, as far as the last times tell: a thread that
// is woken on an idle processor loses far more time than one that looks a little longer.
class LookAgain {
public:
    // How long to look, in nanoseconds; 0 for not at all.
    int64_t GetBudgetNs();
    void Note(bool found);  // of a time that was granted

private:
    int m_Credit = 4;
    unsigned m_Skipped = 0;
};

// What a connection sends, receives and waits for.
struct RemoteApp::Traffic {
    // Guarded by the connection's lock
    bool m_IsRunning = false;
    bool m_WantsEnd = false;                // Disconnect: when nothing is under way any more
    Platform::_Socket* m_Socket = nullptr;  // kInProcess within the process
    RemoteApp* m_Peer = nullptr;            // there; holds a use
    Platform::_Thread* m_Thread = nullptr;
    uint32_t m_LastContext = 0;
    RequestTable m_Requests;
    int64_t m_NextDeadlineNs = INT64_MAX;  // no asynchronous request is due earlier
    uint32_t m_NumUnanswered = 0;
    PacketQueue m_Outgoing;
    int64_t m_HeldUntilNs = 0;  // the first one's delay; 0 when it has not begun

    // Waiting for the UI thread
    std::atomic<uint32_t> m_NumForUI{0};
    std::atomic<uint64_t> m_BytesForUI{0};

    // Waking the thread. The set and its numbers are fixed while it runs.
    Platform::_SocketSet* m_Set = nullptr;
    unsigned int m_WakeEvent = 0;
    int m_SocketEntry = 0;
    std::atomic<uint64_t> m_ThreadID{0};
    std::atomic<bool> m_HasWork{false};
    std::atomic<bool> m_IsAsleep{false};
    std::atomic<bool> m_MustQuit{false};   // _Disconnect: stop sending, and end with the peer
    std::atomic<bool> m_MustClose{false};  // at once: what came from the peer was no packet

    // Connection thread
    Packet* m_Writing = nullptr;
    uint32_t m_NumWritten = 0;
    unsigned char* m_Input = nullptr;  // kInputSize bytes, of which some begin a packet
    uint32_t m_NumInput = 0;
    Packet* m_Reading = nullptr;  // too large for the input buffer
    uint32_t m_NumRead = 0;
    uint32_t m_Capacity = 0;  // of m_Reading
    int64_t m_QuitLimitNs = 0;
    LookAgain m_Look;

    static constexpr uint32_t kInputSize = 65536;
};

}  // namespace Korvel

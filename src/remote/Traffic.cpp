#include <sched.h>

#include <algorithm>
#include <ctime>
#include <utility>

#include "core/ReusePoolInternal.h"
#include "diag/Env.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr uint32_t kFirstBuckets = 16;
constexpr unsigned kTryEach = 32;   // times without credit, after which it is tried again
constexpr int64_t kTurnNs = 50000;  // that a thread with work of its own takes

EnvInt s_PollMicroseconds("KORVEL_PollMicroseconds", true, 50);
EnvInt s_MaxQueueSize("KORVEL_MaxQueueSize", true, 1024);  // in MiB

}  // namespace

uint64_t GetMaxQueueSize() {
    return static_cast<uint64_t>(std::max<int64_t>(s_MaxQueueSize, 0)) << 20;
}

int64_t NowNs() {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return now.tv_sec * int64_t{1000000000} + now.tv_nsec;
}

int64_t DeadlineAfter(double seconds) {
    constexpr double kFar = 1e9;  // some thirty years
    return seconds > 0 && seconds < kFar ? NowNs() + static_cast<int64_t>(seconds * 1e9) : 0;
}

void Waiter::Wait(int64_t deadlineNs) {
    static thread_local LookAgain t_Look;
    if (IsOver() || t_Look.Look([this] { return IsOver(); })) return;
    constexpr int64_t kSecond = 1000000000;
    timespec deadline = {deadlineNs / kSecond, deadlineNs % kSecond};
    uint32_t awake = kAwake;
    m_State.compare_exchange_strong(awake, kAsleep);
    while (!IsOver()) {
        int error = Platform::FutexWaitSteady(m_State, kAsleep, deadlineNs ? &deadline : nullptr);
        if (error == ETIMEDOUT) return;
    }
}

RequestTable::~RequestTable() {
    Request* request = TakeIf([](const Request&) { return true; });
    while (request) {
        if (request->m_Reply) FreePkt(request->m_Reply);
        delete std::exchange(request, request->m_Next);
    }
    g_ReusePoolMgr.Free(m_Buckets);
}

bool RequestTable::Grow() {
    uint32_t size = m_Size ? m_Size * 2 : kFirstBuckets;
    auto** buckets = static_cast<Request**>(g_ReusePoolMgr.Alloc(size * sizeof(Request*)));
    if (!buckets) return false;
    for (uint32_t i = 0; i < size; i++) buckets[i] = nullptr;
    for (uint32_t i = 0; i < m_Size; i++) {
        while (Request* request = m_Buckets[i]) {
            m_Buckets[i] = request->m_Next;
            Request*& bucket = buckets[request->m_Context % size];
            request->m_Next = std::exchange(bucket, request);
        }
    }
    g_ReusePoolMgr.Free(std::exchange(m_Buckets, buckets));
    m_Size = size;
    return true;
}

bool RequestTable::Add(Request* request) {
    if (m_Count >= m_Size && !Grow() && !m_Size) return false;
    Request*& bucket = m_Buckets[request->m_Context % m_Size];
    request->m_Next = std::exchange(bucket, request);
    request->m_IsInTable = true;
    m_Count++;
    return true;
}

Request* RequestTable::Find(uint32_t context) const {
    Request* request = m_Size ? m_Buckets[context % m_Size] : nullptr;
    while (request && request->m_Context != context) request = request->m_Next;
    return request;
}

void RequestTable::Remove(Request* request) {
    Request** link = &m_Buckets[request->m_Context % m_Size];
    while (*link != request) link = &(*link)->m_Next;
    *link = request->m_Next;
    request->m_IsInTable = false;
    m_Count--;
}

PacketQueue::~PacketQueue() {
    while (Packet* packet = Take()) FreePkt(packet);
}

bool PacketQueue::Add(Packet* packet) {
    Node* node = new Node(packet);
    if (!node) return false;
    *m_Last = node;
    m_Last = &node->m_Next;
    m_Bytes += packet->m_Size;
    return true;
}

Packet* PacketQueue::Take() {
    Node* node = m_First;
    if (!node) return nullptr;
    m_First = node->m_Next;
    if (!m_First) m_Last = &m_First;
    Packet* packet = node->m_Packet;
    m_Bytes -= packet->m_Size;
    delete node;
    return packet;
}

int64_t LookAgain::Begin() {
    int64_t now = NowNs();
    bool pays = m_Credit > 0 || ++m_Skipped % kTryEach == 0;
    m_LimitNs = pays ? now + s_PollMicroseconds * 1000 : now;
    return now;
}

int64_t LookAgain::GiveWay(int64_t last) {
    sched_yield();
    int64_t now = NowNs();
    if (now - last > kTurnNs) m_LimitNs = now;  // others have work to do
    return now;
}

}  // namespace Korvel

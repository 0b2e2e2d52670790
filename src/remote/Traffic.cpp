#include <ctime>
#include <utility>

#include "core/ReusePoolInternal.h"
#include "diag/Env.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr uint32_t kFirstBuckets = 16;
constexpr int kMostCredit = 8;
constexpr unsigned kTryEach = 32;  // times without credit, after which it is tried again

EnvInt s_PollMicroseconds("PollMicroseconds", false, 50);

}  // namespace

int64_t NowNs() {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return now.tv_sec * int64_t{1000000000} + now.tv_nsec;
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

int64_t LookAgain::GetBudgetNs() {
    if (m_Credit <= 0 && ++m_Skipped % kTryEach != 0) return 0;
    return s_PollMicroseconds * int64_t{1000};
}

void LookAgain::Note(bool found) {
    if (found && m_Credit < kMostCredit) m_Credit++;
    if (!found && m_Credit > 0) m_Credit--;
}

}  // namespace Korvel

#include <sys/random.h>

#include <bit>
#include <cstring>
#include <utility>

#include "remote/ObjectTableInternal.h"

namespace Korvel {

// The upper half of the product depends on all bits of the key.
uint32_t ObjectTable::Hash(uint64_t key) const {
    return static_cast<uint32_t>(key * m_Factor >> 32) >> (32 - std::countr_zero(m_Size));
}
ObjectRecord** ObjectTable::BucketOf(uint64_t id) const {
    return &m_Buckets[Hash(id)];
}
ObjectRecord** ObjectTable::BucketOf(const ScriptObject* object) const {
    return &m_Buckets[m_Size + Hash(reinterpret_cast<uintptr_t>(object) >> 4)];
}

ObjectRecord* ObjectTable::Find(uint64_t id) const {
    ObjectRecord* record = *BucketOf(id);
    while (record && record->m_ID != id) record = record->m_NextByID;
    return record;
}

ObjectRecord* ObjectTable::Find(const ScriptObject* object) const {
    if (!object) return nullptr;
    ObjectRecord* record = *BucketOf(object);
    while (record && record->m_Object != object) record = record->m_NextByObject;
    return record;
}

ObjectRecord* ObjectTable::FindNext(const ObjectRecord* record) {
    ObjectRecord* next = record->m_NextByObject;
    while (next && next->m_Object != record->m_Object) next = next->m_NextByObject;
    return next;
}

ObjectRecord* ObjectTable::Find(const ScriptObject* object, uint32_t id) const {
    ObjectRecord* record = Find(object);
    while (record && record->m_ID != id) record = FindNext(record);
    return record;
}

void ObjectTable::Link(ObjectRecord* record) {
    ObjectRecord** byID = BucketOf(record->m_ID);
    record->m_NextByID = std::exchange(*byID, record);
    if (!HasAddress(record)) return;
    ObjectRecord** byObject = BucketOf(record->m_Object);
    record->m_NextByObject = std::exchange(*byObject, record);
}

ObjectRecord* ObjectTable::Add(uint32_t id, RemoteApp* app, bool isLocal, ScriptObject* object) {
    if (!m_Free && !AddChunk()) return nullptr;
    if (m_Count >= m_Size / 2) Grow();  // a chain that goes on is a cache miss more
    ObjectRecord* record = m_Free;
    m_Free = record->m_NextByID;
    record->m_ID = id;
    record->m_Object = object;
    record->m_App = app;
    record->m_IsLocal = isLocal;
    Link(record);
    m_Count++;
    return record;
}

void ObjectTable::Remove(ObjectRecord* record) {
    ObjectRecord** link = BucketOf(record->m_ID);
    while (*link != record) link = &(*link)->m_NextByID;
    *link = record->m_NextByID;
    if (HasAddress(record)) {
        link = BucketOf(record->m_Object);
        while (*link != record) link = &(*link)->m_NextByObject;
        *link = record->m_NextByObject;
    }
    *record = {};
    record->m_NextByID = std::exchange(m_Free, record);
    m_Count--;
}

bool ObjectTable::AddChunk() {
    auto* chunk = new RemoteObjectChunk{};
    if (!chunk) return false;
    chunk->m_Next = std::exchange(m_Chunks, chunk);
    for (int i = RemoteObjectChunk::kSize; i-- > 0;) {
        chunk->m_Objects[i].m_NextByID = std::exchange(m_Free, &chunk->m_Objects[i]);
    }
    return true;
}

// Doubles the index. Without memory its chains grow longer instead.
void ObjectTable::Grow() {
    uint32_t size = m_Size * 2;
    size_t bytes = size_t{2} * size * sizeof(ObjectRecord*);
    auto** buckets = size ? static_cast<ObjectRecord**>(g_ReusePoolMgr.Alloc(bytes)) : nullptr;
    if (!buckets) return;
    memset(buckets, 0, bytes);
    uint64_t factor;
    if (getrandom(&factor, sizeof factor, GRND_NONBLOCK) == sizeof factor) m_Factor = factor | 1;
    ObjectRecord** old = std::exchange(m_Buckets, buckets);
    ObjectRecord** oldEnd = old + m_Size;  // those by number
    m_Size = size;
    for (ObjectRecord** bucket = old; bucket != oldEnd; bucket++) {
        for (ObjectRecord* record = *bucket; record;) {
            Link(std::exchange(record, record->m_NextByID));
        }
    }
    if (old != m_FirstBuckets) g_ReusePoolMgr.Free(old);
}

void ObjectTable::Clear() {
    while (m_Chunks) delete std::exchange(m_Chunks, m_Chunks->m_Next);
    if (m_Buckets != m_FirstBuckets) g_ReusePoolMgr.Free(m_Buckets);
    memset(m_FirstBuckets, 0, sizeof m_FirstBuckets);
    m_Buckets = m_FirstBuckets;
    m_Size = kFirstSize;
    m_Count = 0;
    m_Free = nullptr;
}

}  // namespace Korvel

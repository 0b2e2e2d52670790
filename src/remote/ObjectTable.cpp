#include <sys/random.h>

#include <bit>
#include <cassert>
#include <cstring>
#include <utility>

#include "remote/ObjectTableInternal.h"

namespace Korvel {

// Doubles the index when it is three quarters full. Without memory it goes on until one slot is
// left, where searches end.
bool PlaceIndex::Reserve() {
    uint32_t size = 1u << m_Bits;
    if (m_Count < size / 4 * 3) return true;
    bool isFull = m_Count + 1 >= size;
    if (m_Bits >= 31) return !isFull;
    size_t bytes = size_t{2} * size * sizeof(Slot);
    auto* slots = static_cast<Slot*>(g_ReusePoolMgr.Alloc(bytes));
    if (!slots) return !isFull;
    memset(slots, 0, bytes);
    Slot* old = std::exchange(m_Slots, slots);
    m_Bits++;
    m_Count = 0;
    for (uint32_t i = 0; i < size; i++) {
        if (old[i].m_Place) Add(old[i].m_Hash, old[i].m_Place);
    }
    if (old != m_FirstSlots) g_ReusePoolMgr.Free(old);
    return true;
}

void PlaceIndex::Add(uint32_t hash, uint32_t place) {
    m_Slots[FindSlot(hash, [](uint32_t) { return false; })] = {hash, place};
    m_Count++;
}

// What comes behind moves up as far as it may, so that no search ends too early.
void PlaceIndex::Remove(uint32_t hash, uint32_t place) {
    uint32_t hole = FindSlot(hash, [place](uint32_t at) { return at == place; });
    assert(m_Slots[hole].m_Place == place);
    uint32_t mask = Mask();
    for (uint32_t i = (hole + 1) & mask; m_Slots[i].m_Place; i = (i + 1) & mask) {
        uint32_t way = (i - HomeOf(m_Slots[i].m_Hash)) & mask;
        if (way >= ((i - hole) & mask)) m_Slots[std::exchange(hole, i)] = m_Slots[i];
    }
    m_Slots[hole] = {};
    m_Count--;
}

void PlaceIndex::Clear() {
    if (m_Slots != m_FirstSlots) g_ReusePoolMgr.Free(m_Slots);
    m_Slots = m_FirstSlots;
    memset(m_FirstSlots, 0, sizeof m_FirstSlots);
    m_Bits = kFirstBits;
    m_Count = 0;
}

ObjectRecord* ObjectTable::Find(uint64_t id) const {
    if (id > UINT32_MAX) return nullptr;
    uint32_t place = m_ByID.Find(HashOf(static_cast<uint32_t>(id)), [](uint32_t) { return true; });
    return place ? At(place) : nullptr;
}

ObjectRecord* ObjectTable::Add(uint32_t id, RemoteApp* app, bool isLocal, ScriptObject* object) {
    bool hasRoom = (m_Free || AddChunk()) && m_ByID.Reserve() && m_ByObject.Reserve();
    if (!hasRoom) return nullptr;
    uint32_t place = m_Free;
    ObjectRecord* record = At(place);
    m_Free = static_cast<uint32_t>(record->m_SeenAt);
    record->m_SeenAt = 0;
    record->m_ID = id;
    record->m_Object = object;
    record->m_App = app;
    record->m_IsLocal = isLocal;
    m_ByID.Add(HashOf(id), place);
    if (HasAddress(record)) m_ByObject.Add(HashOf(object), place);
    return record;
}

uint32_t ObjectTable::PlaceOf(const ObjectRecord* record) const {
    return m_ByID.Find(HashOf(record->m_ID), [&](uint32_t at) { return At(at) == record; });
}

void ObjectTable::Remove(ObjectRecord* record) {
    uint32_t place = static_cast<uint32_t>(record->m_SeenAt);
    if (!record->m_IsDetached) {
        place = PlaceOf(record);
        m_ByID.Remove(HashOf(record->m_ID), place);
        if (HasAddress(record)) m_ByObject.Remove(HashOf(record->m_Object), place);
    }
    *record = {};
    record->m_SeenAt = std::exchange(m_Free, place);
}

void ObjectTable::Detach(ObjectRecord* record) {
    uint32_t place = PlaceOf(record);
    m_ByID.Remove(HashOf(record->m_ID), place);
    record->m_SeenAt = place;
    record->m_IsDetached = true;
}

bool ObjectTable::AddChunk() {
    if (std::has_single_bit(m_NumParts) || !m_Parts) {
        size_t room = m_Parts ? size_t{2} * m_NumParts : 1;
        auto** parts = static_cast<ObjectRecord**>(g_ReusePoolMgr.Alloc(room * sizeof *m_Parts));
        if (!parts) return false;
        if (m_Parts) memcpy(parts, m_Parts, m_NumParts * sizeof *m_Parts);
        g_ReusePoolMgr.Free(std::exchange(m_Parts, parts));
    }
    auto* chunk = new RemoteObjectChunk;
    if (!chunk) return false;
    if (!m_Chunks) {
        m_Factor = 0x9E3779B97F4A7C15u;
        uint64_t factor;
        ssize_t size = getrandom(&factor, sizeof factor, GRND_NONBLOCK);
        if (size == sizeof factor) m_Factor = factor | 1;
    }
    chunk->m_Next = std::exchange(m_Chunks, chunk);
    m_Parts[m_NumParts++] = chunk->begin();
    uint32_t place = m_NumParts * RemoteObjectChunk::kSize;
    for (ObjectRecord* record = chunk->end(); record-- != chunk->begin(); place--) {
        *record = {};
        record->m_SeenAt = std::exchange(m_Free, place);
    }
    return true;
}

void ObjectTable::Clear() {
    while (m_Chunks) delete std::exchange(m_Chunks, m_Chunks->m_Next);
    g_ReusePoolMgr.Free(std::exchange(m_Parts, nullptr));
    m_NumParts = 0;
    m_Free = 0;
    m_ByID.Clear();
    m_ByObject.Clear();
}

}  // namespace Korvel

#pragma once

#include <cstddef>
#include <cstdint>

#include "core/0ReusePool.h"
#include "remote/RemoteObject.h"

namespace Korvel {

// A record and what the tables note beside it, in one line of the processor's cache.
struct ObjectRecord : RemoteObject {
    // Of a connection's export: the record of the process, which is another object's or free when
    // it has another serial number.
    ObjectRecord* m_Known;
    uint64_t m_Serial;          // never used twice
    uint64_t m_SeenAt : 43;     // how many objects had died when this one was last seen alive
    uint64_t m_IsLeaving : 1;   // the last count is gone; the record follows with the last pin
    uint64_t m_IsDetached : 1;  // not found by its number; m_SeenAt is its place
    uint64_t m_Pins : 19;       // threads that hold on to the record while they count its object
};

static_assert(sizeof(ObjectRecord) == 64);

// A part of a table, in which records stay in place.
struct RemoteObjectChunk : Reuser {
    static constexpr int kSize = 64;

    ObjectRecord* begin() {
        uintptr_t at = reinterpret_cast<uintptr_t>(m_Room) + sizeof(ObjectRecord) - 1;
        return reinterpret_cast<ObjectRecord*>(at / sizeof(ObjectRecord) * sizeof(ObjectRecord));
    }
    ObjectRecord* end() { return begin() + kSize; }

    RemoteObjectChunk* m_Next;  // fixed, so that chunks can be walked while others are added
    unsigned char m_Room[(kSize + 1) * sizeof(ObjectRecord)];  // pools align less than a record is
};

// Places in a table, found by the hash of something that stands there. Open addressing: a search
// goes on in the same line of the cache.
class PlaceIndex {
public:
    constexpr PlaceIndex() = default;
    PlaceIndex(const PlaceIndex&) = delete;
    PlaceIndex& operator=(const PlaceIndex&) = delete;

    // The first place of this hash that `isIt` takes; 0 for none.
    template <class IsIt>
    uint32_t Find(uint32_t hash, IsIt&& isIt) const {
        return m_Slots[FindSlot(hash, isIt)].m_Place;
    }
    bool Reserve();  // room for one more; false without memory
    void Add(uint32_t hash, uint32_t place);
    void Remove(uint32_t hash, uint32_t place);
    void Clear();

private:
    struct Slot {
        uint32_t m_Hash;
        uint32_t m_Place;  // 0 for a free one
    };
    static constexpr uint32_t kFirstBits = 4;

    uint32_t HomeOf(uint32_t hash) const { return hash >> (32 - m_Bits); }
    uint32_t Mask() const { return (1u << m_Bits) - 1; }
    template <class IsIt>
    uint32_t FindSlot(uint32_t hash, IsIt&& isIt) const {
        uint32_t i = HomeOf(hash);
        while (m_Slots[i].m_Place && !(m_Slots[i].m_Hash == hash && isIt(m_Slots[i].m_Place))) {
            i = (i + 1) & Mask();
        }
        return i;
    }

    Slot m_FirstSlots[1 << kFirstBits] = {};
    Slot* m_Slots = m_FirstSlots;
    uint32_t m_Bits = kFirstBits;
    uint32_t m_Count = 0;
};

// Records of objects, found by number and by address in constant time. Two records may have one
// address: that of an object that has died, and that of its successor.
//
// Numbers may come from a peer, which must not be able to choose those that meet in one place of
// the index: a random factor spreads them.
//
// Ownership: of its chunks, until Clear. A table may be constant-initialised and never cleared.
// Threads:   one at a time; whoever shares a table guards it.
class ObjectTable {
public:
    constexpr ObjectTable() = default;
    ObjectTable(const ObjectTable&) = delete;
    ObjectTable& operator=(const ObjectTable&) = delete;

    ObjectRecord* Find(uint64_t id) const;
    // By address, of records that are local: the first one that `isIt` takes.
    template <class IsIt>
    ObjectRecord* FindIf(const ScriptObject* object, IsIt&& isIt) const {
        if (!object) return nullptr;
        uint32_t place = m_ByObject.Find(HashOf(object), [&](uint32_t at) {
            ObjectRecord* record = At(at);
            return record->m_Object == object && isIt(record);
        });
        return place ? At(place) : nullptr;
    }
    ObjectRecord* Find(const ScriptObject* object) const {
        return FindIf(object, [](ObjectRecord*) { return true; });
    }

    // A record with these fields, the rest zero; null without memory. They stay as they are, but
    // for the object of a record that is not local.
    ObjectRecord* Add(uint32_t id, RemoteApp* app, bool isLocal, ScriptObject* object);
    void Remove(ObjectRecord* record);  // frees it
    void Detach(ObjectRecord* record);  // it stays, but is found no more; one that is not local

    // The chunks in use at this moment, as a chain.
    RemoteObjectChunk* GetChunks() const { return m_Chunks; }

    void Clear();  // frees all memory; the table is then empty

private:
    // Places count from 1 on, through all chunks.
    ObjectRecord* At(uint32_t place) const {
        return m_Parts[(place - 1) / RemoteObjectChunk::kSize] +
               (place - 1) % RemoteObjectChunk::kSize;
    }
    // Different for different numbers.
    uint32_t HashOf(uint32_t id) const {
        uint32_t hash = id * static_cast<uint32_t>(m_Factor);
        return (hash ^ hash >> 15) * 0x9E3779B1u;
    }
    uint32_t HashOf(const ScriptObject* object) const {
        return static_cast<uint32_t>((reinterpret_cast<uintptr_t>(object) >> 4) * m_Factor >> 32);
    }
    uint32_t PlaceOf(const ObjectRecord* record) const;
    static bool HasAddress(const ObjectRecord* record) {
        return record->m_IsLocal && record->m_Object;
    }
    bool AddChunk();

    uint64_t m_Factor = 0;  // odd, once there are records
    PlaceIndex m_ByID;
    PlaceIndex m_ByObject;
    ObjectRecord** m_Parts = nullptr;  // the records of each chunk, oldest first
    uint32_t m_NumParts = 0;           // there is room for the next power of two
    uint32_t m_Free = 0;               // a place; the next one stands in m_SeenAt
    RemoteObjectChunk* m_Chunks = nullptr;
};

}  // namespace Korvel

#pragma once

#include <cstdint>

#include "core/0ReusePool.h"
#include "remote/RemoteObject.h"

namespace Korvel {

// A record with its place in the index. A free one is zero but for m_NextByID.
struct ObjectRecord : RemoteObject {
    // Of a connection's export: the record of the process, which is another object's or free when
    // it has another serial number.
    ObjectRecord* m_Known;
    uint64_t m_Serial;  // never used twice
    uint32_t m_Pins;    // threads that hold on to the record while they count its object
    bool m_IsLeaving;   // the last count is gone; the record follows with the last pin

    ObjectRecord* m_NextByID;
    ObjectRecord* m_NextByObject;
};

// A part of a table, in which records stay in place.
struct RemoteObjectChunk : Reuser {
    static constexpr int kSize = 64;
    RemoteObjectChunk* m_Next;  // fixed, so that chunks can be walked while others are added
    ObjectRecord m_Objects[kSize];
};

// Records of objects, found by number and by address in constant time. Two records may have one
// address: that of an object that has died, and that of its successor.
//
// Numbers may come from a peer, which must not be able to choose those that meet in one bucket:
// from the first time that the index grows, a random factor spreads them.
//
// Ownership: of its chunks, until Clear. A table may be constant-initialised and never cleared.
// Threads:   one at a time; whoever shares a table guards it.
class ObjectTable {
public:
    constexpr ObjectTable() = default;
    ObjectTable(const ObjectTable&) = delete;
    ObjectTable& operator=(const ObjectTable&) = delete;

    ObjectRecord* Find(uint64_t id) const;
    // By address, of records that are local: any one of them, or that with the number.
    ObjectRecord* Find(const ScriptObject* object) const;
    ObjectRecord* Find(const ScriptObject* object, uint32_t id) const;
    static ObjectRecord* FindNext(const ObjectRecord* record);  // another one of its address

    // A record with these fields, the rest zero; null without memory. They stay as they are, but
    // for the object of a record that is not local.
    ObjectRecord* Add(uint32_t id, RemoteApp* app, bool isLocal, ScriptObject* object);
    void Remove(ObjectRecord* record);  // frees it

    // The chunks in use at this moment, as a chain.
    RemoteObjectChunk* GetChunks() const { return m_Chunks; }

    void Clear();  // frees all memory; the table is then empty

private:
    static constexpr uint32_t kFirstSize = 8;  // buckets; always a power of two

    ObjectRecord** BucketOf(uint64_t id) const;
    ObjectRecord** BucketOf(const ScriptObject* object) const;
    uint32_t Hash(uint64_t key) const;
    static bool HasAddress(const ObjectRecord* record) {
        return record->m_IsLocal && record->m_Object;
    }
    void Link(ObjectRecord* record);
    bool AddChunk();
    void Grow();

    ObjectRecord* m_FirstBuckets[2 * kFirstSize] = {};
    ObjectRecord** m_Buckets = m_FirstBuckets;  // by number, then as many by address
    uint32_t m_Size = kFirstSize;
    uint32_t m_Count = 0;
    uint64_t m_Factor = 0x9E3779B97F4A7C15u;  // odd
    RemoteObjectChunk* m_Chunks = nullptr;
    ObjectRecord* m_Free = nullptr;  // a chain through m_NextByID
};

}  // namespace Korvel

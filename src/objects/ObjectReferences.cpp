// Two hash tables over the same entries, from objects to numbers and back. An entry is one block
// that hangs in a chain of either. All of it is constant-initialised and never destroyed: objects
// of hosts live before and after the library's own static objects. Memory is taken and given back
// outside of the lock.
#include "objects/ObjectReferences.h"

#include <atomic>
#include <cstring>
#include <utility>

#include "Platform/NoKillInternal.h"
#include "core/0ReusePool.h"
#include "core/Annotations.h"
#include "core/ScriptHooksInternal.h"
#include "core/SpinLockInternal.h"
#include "objects/ScriptObject.h"

namespace Korvel {
namespace {

struct Entry : Reuser {
    const ScriptObject* m_Object = nullptr;
    uint64_t m_Ref = 0;
    Entry* m_NextByObject = nullptr;
    Entry* m_NextByRef = nullptr;
};

constexpr size_t kFirstSize = 64;  // chains; always a power of two

constinit Entry* s_FirstChains[2 * kFirstSize] = {};

// Guarded by s_ObjRefMapLock
constinit Entry** s_ObjRefMap = s_FirstChains;
constinit Entry** s_RefObjMap = s_FirstChains + kFirstSize;  // in one block with the other
constinit size_t s_EntryCount = 0;

constinit SpinLock s_ObjRefMapLock;                // LockRank::Last
constinit std::atomic<size_t> s_Size{kFirstSize};  // written under the lock
constinit std::atomic<uint64_t> s_NextObjRef{1};

size_t GetMask() {
    return s_Size.load(std::memory_order_relaxed) - 1;
}
Entry** ChainOf(const ScriptObject* object) {
    uint64_t hash = (reinterpret_cast<uintptr_t>(object) >> 4) * 0x9E3779B97F4A7C15u;
    return &s_ObjRefMap[(hash >> 32) & GetMask()];
}
Entry** ChainOf(uint64_t ref) {
    return &s_RefObjMap[ref & GetMask()];  // numbers in a row: no two meet before all are taken
}

Entry* FindLocked(const ScriptObject* object) {
    Entry* entry = *ChainOf(object);
    while (entry && entry->m_Object != object) entry = entry->m_NextByObject;
    return entry;
}

Entry* FindLocked(uint64_t ref) {
    Entry* entry = *ChainOf(ref);
    while (entry && entry->m_Ref != ref) entry = entry->m_NextByRef;
    return entry;
}

void LinkLocked(Entry* entry) {
    Entry** byObject = ChainOf(entry->m_Object);
    entry->m_NextByObject = std::exchange(*byObject, entry);
    Entry** byRef = ChainOf(entry->m_Ref);
    entry->m_NextByRef = std::exchange(*byRef, entry);
}

void UnlinkLocked(Entry* entry) {
    Entry** link = ChainOf(entry->m_Object);
    while (*link != entry) link = &(*link)->m_NextByObject;
    *link = entry->m_NextByObject;
    link = ChainOf(entry->m_Ref);
    while (*link != entry) link = &(*link)->m_NextByRef;
    *link = entry->m_NextByRef;
}

// Moves all entries to the new block, and returns the old one.
Entry** RehashLocked(Entry** chains, size_t size) {
    Entry** old = s_ObjRefMap;
    Entry** oldEnd = old + GetMask() + 1;
    s_ObjRefMap = chains;
    s_RefObjMap = chains + size;
    s_Size.store(size, std::memory_order_relaxed);
    for (Entry** chain = old; chain != oldEnd; chain++) {
        for (Entry* entry = *chain; entry;) {
            Entry* next = entry->m_NextByObject;
            LinkLocked(entry);
            entry = next;
        }
    }
    return old;
}

// Doubles the tables. Without memory the chains grow longer instead.
void Grow() {
    size_t size = s_Size.load(std::memory_order_relaxed) * 2;
    size_t bytes = 2 * size * sizeof(Entry*);
    auto chains = static_cast<Entry**>(ReusePoolManager::Get().Alloc(bytes));
    if (!chains) return;
    memset(chains, 0, bytes);
    {
        AutoPlacedLock lock(LockRank::Last, s_ObjRefMapLock);
        // Another thread may have been first: then the new block is the one that goes.
        if (s_Size.load(std::memory_order_relaxed) < size) chains = RehashLocked(chains, size);
    }
    if (chains != s_FirstChains) ReusePoolManager::Get().Free(chains);
}

}  // namespace

uint64_t ObjectReferences::GetObjectReference(const ScriptObject* object) {
    if (!object) return 0;
    AutoPlacedLock lock(LockRank::Last, s_ObjRefMapLock);
    Entry* entry = FindLocked(object);
    return entry ? entry->m_Ref : 0;
}

ScriptObject* ObjectReferences::GetReferenceObject(unsigned long long ref) {
    AutoPlacedLock lock(LockRank::Last, s_ObjRefMapLock);
    Entry* entry = FindLocked(uint64_t{ref});
    return entry ? const_cast<ScriptObject*>(entry->m_Object) : nullptr;
}

uint64_t ObjectReferences::AddObjectReference(const ScriptObject* object) {
    if (!object) return 0;
    if (object->m_ObjectFlags.load(std::memory_order_relaxed) & SOF_HasReference) {
        if (uint64_t ref = GetObjectReference(object)) return ref;
    }
    Platform::NoKill noKill;
    Entry* added = new Entry;
    if (!added) return 0;
    uint64_t ref;
    bool isFull = false;
    {
        AutoPlacedLock lock(LockRank::Last, s_ObjRefMapLock);
        if (Entry* known = FindLocked(object)) {
            ref = known->m_Ref;
        } else {
            ref = s_NextObjRef.fetch_add(1, std::memory_order_relaxed);
            added->m_Object = object;
            added->m_Ref = ref;
            LinkLocked(std::exchange(added, nullptr));
            object->m_ObjectFlags.fetch_or(SOF_HasReference, std::memory_order_relaxed);
            isFull = ++s_EntryCount > GetMask();
        }
    }
    delete added;
    if (isFull) Grow();
    return ref;
}

bool ObjectReferences::ClearObjectReferences(ScriptObject* object, bool dropCounts) {
    if (!object) return false;
    {
        Platform::NoKill noKill;
        Entry* entry;
        {
            AutoPlacedLock lock(LockRank::Last, s_ObjRefMapLock);
            entry = FindLocked(object);
            if (entry) {
                UnlinkLocked(entry);
                s_EntryCount--;
            }
            object->m_ObjectFlags.fetch_and(~SOF_HasReference, std::memory_order_relaxed);
        }
        delete entry;
    }
    return g_ScriptHooks.m_ForgetExports(object, dropCounts);
}

}  // namespace Korvel

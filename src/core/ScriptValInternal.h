#pragma once

#include <strings.h>

#include <cstdint>
#include <cstring>
#include <memory>
#include <type_traits>
#include <utility>

#include "core/OxID.h"
#include "core/ReusePoolInternal.h"
#include "core/ScriptVal.h"
#include "core/TextCellInternal.h"
#include "core/TextProbeInternal.h"

// What the sources of ScriptVal share: text payloads, chains of entries, walks without recursion.
namespace Korvel {

// The calling thread's `invalid`, as a plain nil; and whether a value is that one.
ScriptVal& InvalidValue();
bool IsInvalid(const ScriptVal& value);

// Releases a chain that no value holds any more: entry by entry from the head, the value before the
// key, what they hold in the same order. It needs no memory and no stack for the depth. Host code
// may run for each object.
void ReleaseChain(TableEntry* chain);

// Sends a command to the object of a proxy, which it holds meanwhile, and waits for the reply;
// false when there was none.
bool SendCommand(ScriptVal proxy, int opcode, ScriptArgs& args, ScriptVal& reply);

// True when memory did not suffice for a copy. A dead object becomes a nil in any case.
inline bool IsLostCopy(const ScriptVal& copy, const ScriptVal& original) {
    if (!copy.IsNil() || original.IsNil()) return false;
    return !original.IsLocalObject(true) || original.ToLocalObject();
}

// Makes a nil the string of a cell, which it takes over; the length is the one up to the NUL.
inline void AdoptText(ScriptVal& value, uint32_t flags, const char* cell, size_t length) {
    const char* text = cell + 1;
    value.m_Flags = flags;
    value.m_Value.m_String = {const_cast<char*>(cell), GetHashValue(text, static_cast<int>(length)),
                              GetTextProbe(text, length)};
}

// Entries are made and freed so often that both are done in line. Null without memory.
template <class... Args>
TableEntry* NewEntry(Args&&... args) {
    void* memory = PoolAccess::Alloc(sizeof(TableEntry));
    return memory ? new (memory) TableEntry(std::forward<Args>(args)...) : nullptr;
}

// Frees the memory of an entry whose key and value hold nothing any more.
inline void FreeEntry(TableEntry* entry) {
    PoolAccess::Free(entry);
}

// The text of a look-up, never null. With a length it ends there, or at a NUL before; without one
// at the NUL.
class KeyText {
public:
    explicit KeyText(const char* text)
        : m_Text(text ? TextCell::Text(text) : ""), m_Length(strlen(m_Text)) {}
    KeyText(const char* text, int length)
        : m_Text(text ? text : ""),
          m_Length(length > 0 ? strnlen(m_Text, static_cast<size_t>(length)) : 0) {}
    explicit KeyText(const ScriptVal& key) : KeyText(key.ToString()) {}

    const char* Get() const { return m_Text; }
    size_t GetLength() const { return m_Length; }

    bool Equals(const char* text) const {
        return strncmp(text, m_Text, m_Length) == 0 && text[m_Length] == '\0';
    }
    bool EqualsNoCase(const char* text) const {
        return strncasecmp(text, m_Text, m_Length) == 0 && text[m_Length] == '\0';
    }
    ScriptVal ToValue() const { return ScriptVal(m_Text, static_cast<int>(m_Length)); }

private:
    const char* m_Text;
    size_t m_Length;
};

// A block of the pools with nothing in it that would have to be destroyed.
struct FreePoolBlock {
    void operator()(void* block) const { g_ReusePoolMgr.Free(block); }
};
template <class T>
using PoolBlock = std::unique_ptr<T, FreePoolBlock>;

// A stack of work to be done, for values that nest deeper than the machine's stack. The first
// `Inline` items need no memory.
template <class T, unsigned Inline = 24>
class WorkStack {
    static_assert(std::is_trivially_copyable_v<T>);

public:
    WorkStack() = default;
    WorkStack(const WorkStack&) = delete;
    WorkStack& operator=(const WorkStack&) = delete;
    ~WorkStack() {
        if (m_Items != m_First) g_ReusePoolMgr.Free(m_Items);
    }

    bool IsEmpty() const { return m_Count == 0; }
    T Pop() { return m_Items[--m_Count]; }

    // False when there is no memory.
    [[nodiscard]] bool Push(const T& item) {
        if (m_Count == m_Room && !Grow()) return false;
        m_Items[m_Count++] = item;
        return true;
    }

private:
    bool Grow() {
        T* items = static_cast<T*>(g_ReusePoolMgr.Alloc(m_Room * 2 * sizeof(T)));
        if (!items) return false;
        memcpy(static_cast<void*>(items), m_Items, m_Count * sizeof(T));
        if (m_Items != m_First) g_ReusePoolMgr.Free(m_Items);
        m_Items = items;
        m_Room *= 2;
        return true;
    }

    T m_First[Inline];
    T* m_Items = m_First;
    unsigned long m_Count = 0;
    unsigned long m_Room = Inline;
};

// The chain of a table or args list.
//
// Number keys ascend among themselves, so a search for one ends at the first greater one; NaN is
// neither found nor greater. A table knows its last entry, an args list does not: there the
// connection stands in that place.
namespace Chain {

inline TableEntry* Head(const ScriptVal& list) {
    return list.m_Value.m_Table.m_Table;
}

inline bool IsList(const ScriptVal& value) {
    return value.IsTable() || value.IsArgs();
}

// An entry counts when its key is not nil and its value is kept.
inline bool Counts(const TableEntry* entry) {
    return !entry->m_Key.IsNil() && entry->m_Value.KeepMe();
}

// The first entry from `entry` on that counts, or null.
inline TableEntry* FirstThatCounts(TableEntry* entry) {
    while (entry && !Counts(entry)) entry = entry->m_Next;
    return entry;
}

// The number of the entry's key; NaN when it has another one.
inline double NumberOf(const TableEntry* entry) {
    return entry->m_Key.IsNumber() ? entry->m_Key.m_Value.m_Number : __builtin_nan("");
}

TableEntry* Find(const ScriptVal& list, const ScriptVal& key);
TableEntry* FindNumber(const ScriptVal& list, double key);
TableEntry* FindText(const ScriptVal& list, const KeyText& key);
TableEntry* FindTextNoCase(const ScriptVal& list, const KeyText& key);

// The entry of a number key, made if need be, with the flags of the key changed; null when the list
// is read-only and has none, and without memory.
TableEntry* Obtain(ScriptVal& list, double key, uint32_t set, uint32_t clear);

// Puts an entry where its key belongs; the key must not be there yet.
void Insert(ScriptVal& list, TableEntry* entry);
// Puts an entry at the end of the list.
void Append(ScriptVal& list, TableEntry* entry);

}  // namespace Chain
}  // namespace Korvel

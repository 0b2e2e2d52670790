// Tables: an array part for the keys 1 to n, and a hash part of nodes.
//
// The hash part is a chained scatter table: chains run inside the node array, and a key stands at
// its main position unless a key stands there that is at its own. The order of a walk follows from
// the hashes and from the order of insertion, and texts are written in that order, so each step
// here counts.
//
// An ordered table (kHashed clear) has one chain: the main position of all keys is the last node,
// free nodes are taken downward, and a walk goes downward, so keys come in the order of insertion.
#pragma once

#include "textform/Value.h"

namespace Korvel::TextForm {

// A key and its link share 16 bytes.
struct Key {
    union {
        Object* m_Object;
        double m_Number;
        uint64_t m_Boolean;
    };
    Type m_Type;
    int32_t m_Next;  // distance in nodes to the next one of the chain, 0 at the end

    Value Get() const {
        Value value;
        value.m_Object = m_Object;
        value.m_Type = m_Type;
        return value;
    }
    void Set(const Value& value) {
        m_Object = value.m_Object;
        m_Type = value.m_Type;
    }
};

struct Node {
    Value m_Value;
    Key m_Key;
};
static_assert(sizeof(Node) == 32);

struct Table : Object {
    static constexpr uint32_t kHashed = 1;     // clear in an ordered table
    static constexpr uint32_t kListItems = 2;  // its constructor stored list items
    static constexpr uint32_t kCompact = 4;    // its first field ended on the line of the brace

    Value* m_Array;
    Node* m_Nodes;
    Node* m_LastFree;  // all nodes from here on are taken
    Table* m_Metatable;
    Object* m_GcList;
    int m_ArraySize;
    uint32_t m_Flags;

    bool IsHashed() const { return (m_Flags & kHashed) != 0; }
    bool HasNodes() const;
    int CountNodes() const { return 1 << m_Log; }
    Node* GetLastNode() const { return m_Nodes + CountNodes() - 1; }

    Node* GetMainNode(const String* key) const {
        return IsHashed() ? m_Nodes + (key->m_Hash & (CountNodes() - 1)) : GetLastNode();
    }

    // The value of a key. Nil when there is none: never a slot to write to, except through Find.
    const Value* Get(const String* key) const;
    const Value* Get(int key) const;
    const Value* Get(const Value& key) const;
};

extern const Value g_Nil;

// A table with room for so many items and named fields. Takes the one-shot of the thread.
Table* NewTable(State& L, int arraySize, int nodeCount);
void FreeTable(Machine& machine, Table* table);

// Where the value of a key stands; makes the entry if need be. The caller stores a value and passes
// the barrier.
Value* SetSlot(State& L, Table* table, const Value& key);
Value* SetSlot(State& L, Table* table, int key);
Value* SetSlot(State& L, Table* table, String* key);

// Gives the array part room up to `size`.
void ResizeArray(State& L, Table* table, int size);

// One step of a walk: replaces key[0] by the next key and key[1] by its value. False at the end.
// Raises an error for a key that is not in the table.
bool Next(State& L, Table* table, Value* key);

// A border: n with a value at n and none at n + 1, or 0.
int GetLength(const Table* table);

inline const Value* Table::Get(const String* key) const {
    const Node* node = GetMainNode(key);
    for (;;) {
        if (node->m_Key.m_Object == key && node->m_Key.m_Type == Type::String) {
            return &node->m_Value;
        }
        if (!node->m_Key.m_Next) return &g_Nil;
        node += node->m_Key.m_Next;
    }
}

inline const Value* Table::Get(int key) const {
    if (static_cast<unsigned>(key) - 1 < static_cast<unsigned>(m_ArraySize)) {
        return m_Array + key - 1;
    }
    return Get(Value::Number(key));
}

}  // namespace Korvel::TextForm

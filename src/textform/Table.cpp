#include "textform/Table.h"

#include <algorithm>
#include <climits>

#include "textform/Machine.h"
#include "textform/State.h"

namespace Korvel::TextForm {

constinit const Value g_Nil(Type::Nil, nullptr);

namespace {

constexpr int kMaxBits = 26;

// What all tables without nodes share; nothing is ever stored there.
constinit Node s_NoNodes = {{Type::Nil, nullptr}, {{.m_Object = nullptr}, Type::Nil, 0}};

unsigned HashNumber(double number) {
    if (number == 0) return 0;  // 0 and -0 are one key
    uint32_t halves[2];
    memcpy(halves, &number, sizeof halves);
    return halves[0] + halves[1];
}

// Addresses and numbers have common low bits, so they are taken by an odd modulus.
Node* GetNodeByModulus(const Table* table, unsigned hash) {
    return table->m_Nodes + hash % ((table->CountNodes() - 1) | 1);
}

Node* GetMainNode(const Table* table, const Value& key) {
    if (!table->IsHashed()) return table->GetLastNode();
    switch (key.m_Type) {
        case Type::Number:
            return GetNodeByModulus(table, HashNumber(key.m_Number));
        case Type::String:
            return table->m_Nodes + (key.AsString()->m_Hash & (table->CountNodes() - 1));
        case Type::Boolean:
            return table->m_Nodes + (key.m_Boolean & (table->CountNodes() - 1));
        default:
            return GetNodeByModulus(
                table, static_cast<unsigned>(reinterpret_cast<uintptr_t>(key.m_Object)));
    }
}

// The array index that a key stands for, or 0.
int GetArrayIndex(const Value& key) {
    if (!key.IsNumber()) return 0;
    int index = ToInt32(key.m_Number);
    return index == key.m_Number && index > 0 ? index : 0;
}

// The smallest exponent with 2 to its power at least n.
int CeilLog2(unsigned n) {
    return n <= 1 ? 0 : 32 - __builtin_clz(n - 1);
}

void SetNodes(State& L, Table* table, int count) {
    if (count == 0) {
        table->m_Nodes = table->m_LastFree = &s_NoNodes;
        table->m_Log = 0;
        return;
    }
    int log = CeilLog2(count);
    if (log > kMaxBits) L.RunError("table overflow");
    size_t size = size_t{1} << log;
    Node* nodes = L.GetMachine().NewArray<Node>(size);
    std::fill_n(nodes, size, s_NoNodes);
    table->m_Nodes = nodes;
    table->m_LastFree = nodes + size;
    table->m_Log = static_cast<uint8_t>(log);
}

void SetArraySize(State& L, Table* table, int size) {
    Machine& machine = L.GetMachine();
    table->m_Array = machine.ResizeArray(table->m_Array, table->m_ArraySize, size);
    for (int i = table->m_ArraySize; i < size; i++) table->m_Array[i] = g_Nil;
    table->m_ArraySize = size;
}

// Gives both parts new sizes and puts back what no longer fits, oldest first in an ordered table.
void Resize(State& L, Table* table, int arraySize, int nodeCount) {
    int oldArraySize = table->m_ArraySize;
    Node* oldNodes = table->m_Nodes;
    int oldCount = table->HasNodes() ? table->CountNodes() : 0;
    if (arraySize > oldArraySize) SetArraySize(L, table, arraySize);
    SetNodes(L, table, nodeCount);
    if (arraySize < oldArraySize) {
        table->m_ArraySize = arraySize;
        for (int i = arraySize; i < oldArraySize; i++) {
            if (!table->m_Array[i].IsNil()) *SetSlot(L, table, i + 1) = table->m_Array[i];
        }
        table->m_Array = L.GetMachine().ResizeArray(table->m_Array, oldArraySize, arraySize);
    }
    for (int i = oldCount - 1; i >= 0; i--) {
        const Node& old = oldNodes[i];
        if (!old.m_Value.IsNil()) *SetSlot(L, table, old.m_Key.Get()) = old.m_Value;
    }
    if (oldCount) L.GetMachine().FreeArray(oldNodes, oldCount);
}

// How many index keys lie between two powers of 2: m_Slices[i] counts (2^(i-1), 2^i].
struct IndexCensus {
    int m_Slices[kMaxBits + 1] = {};
    int m_Total = 0;

    void Add(const Value& key) {
        int index = GetArrayIndex(key);
        if (index == 0 || index > 1 << kMaxBits) return;
        m_Slices[CeilLog2(index)]++;
        m_Total++;
    }

    void AddArray(const Table* table) {
        int i = 1;
        for (int slice = 0, end = 1; slice <= kMaxBits; slice++, end *= 2) {
            int limit = std::min(end, table->m_ArraySize);
            if (i > limit) break;
            int count = 0;
            for (; i <= limit; i++) count += !table->m_Array[i - 1].IsNil();
            m_Slices[slice] += count;
            m_Total += count;
        }
    }

    // The largest power of 2 of which more than half would be in use, and how many those are.
    int GetBestSize(int& inUse) const {
        int best = 0;
        int sum = 0;
        inUse = 0;
        for (int i = 0, size = 1; i <= kMaxBits && size / 2 < m_Total; i++, size *= 2) {
            if (m_Slices[i] == 0) continue;
            sum += m_Slices[i];
            if (sum > size / 2) {
                best = size;
                inUse = sum;
            }
            if (sum == m_Total) break;
        }
        return best;
    }
};

// Makes room for one key more.
void Rehash(State& L, Table* table, const Value& newKey) {
    IndexCensus census;
    census.AddArray(table);
    int total = census.m_Total;
    int count = table->CountNodes();
    L.Charge(count / 16);
    for (int i = 0; i < count; i++) {
        const Node& node = table->m_Nodes[i];
        if (node.m_Value.IsNil()) continue;
        census.Add(node.m_Key.Get());
        total++;
    }
    census.Add(newKey);
    total++;
    int inArray;
    int arraySize = census.GetBestSize(inArray);
    Resize(L, table, arraySize, total - inArray);
}

Node* TakeFreeNode(Table* table) {
    while (table->m_LastFree > table->m_Nodes) {
        table->m_LastFree--;
        if (table->m_LastFree->m_Key.m_Type == Type::Nil) return table->m_LastFree;
    }
    return nullptr;
}

// Moves the node at `from` to `to`, which is free, and lets its chain follow.
void MoveNode(Table* table, Node* from, Node* to) {
    Node* previous = GetMainNode(table, from->m_Key.Get());
    while (previous + previous->m_Key.m_Next != from) previous += previous->m_Key.m_Next;
    previous->m_Key.m_Next = static_cast<int32_t>(to - previous);
    *to = *from;
    if (from->m_Key.m_Next) to->m_Key.m_Next += static_cast<int32_t>(from - to);
    from->m_Key.m_Next = 0;
    from->m_Value = g_Nil;
}

// Foreign text pays for keys that were chosen so that all stand in one chain.
void ChargeChain(State& L, const Table* table, const Node* node) {
    if (!L.GetMachine().m_IsLimited || !table->IsHashed()) return;
    size_t steps = 0;
    for (; node->m_Key.m_Next; node += node->m_Key.m_Next) steps++;
    L.Charge(steps / 16);
}

// Adds a key that is not there.
Value* AddKey(State& L, Table* table, const Value& key) {
    Node* node = GetMainNode(table, key);
    if (!node->m_Value.IsNil() || node == &s_NoNodes) {
        Node* free = TakeFreeNode(table);
        if (!free) {
            Rehash(L, table, key);
            return SetSlot(L, table, key);
        }
        if (GetMainNode(table, node->m_Key.Get()) != node) {
            MoveNode(table, node, free);
        } else {
            ChargeChain(L, table, node);
            int32_t next = node->m_Key.m_Next;
            free->m_Key.m_Next = next ? next + static_cast<int32_t>(node - free) : 0;
            node->m_Key.m_Next = static_cast<int32_t>(free - node);
            node = free;
        }
    }
    node->m_Key.Set(key);
    L.GetMachine().BarrierBack(table, key);
    return &node->m_Value;
}

const Value* Search(const Table* table, const Value& key) {
    for (const Node* node = GetMainNode(table, key);; node += node->m_Key.m_Next) {
        if (RawEquals(node->m_Key.Get(), key)) return &node->m_Value;
        if (!node->m_Key.m_Next) return &g_Nil;
    }
}

// The place of a key in a walk, from 0 on.
int FindPlace(State& L, const Table* table, const Value& key) {
    if (key.IsNil()) return 0;
    int index = GetArrayIndex(key);
    if (index > 0 && index <= table->m_ArraySize) return index;
    const Node* node = GetMainNode(table, key);
    for (;;) {
        const Key& other = node->m_Key;
        // A key that was collected still marks where its walk is.
        if (RawEquals(other.Get(), key) ||
            (other.m_Type == Type::DeadKey && key.IsObject() && other.m_Object == key.m_Object)) {
            int place = static_cast<int>(node - table->m_Nodes);
            if (!table->IsHashed()) place = table->CountNodes() - 1 - place;
            return place + 1 + table->m_ArraySize;
        }
        if (!other.m_Next) L.RunError("invalid key to 'next'");
        node += other.m_Next;
    }
}

// A border beyond the array part.
int SearchBorder(const Table* table, unsigned low) {
    unsigned high = low + 1;
    while (!table->Get(static_cast<int>(high))->IsNil()) {
        low = high;
        high *= 2;
        if (high > INT_MAX) {  // somebody built it to be so: count
            int i = 1;
            while (!table->Get(i)->IsNil()) i++;
            return i - 1;
        }
    }
    while (high - low > 1) {
        unsigned middle = (low + high) / 2;
        (table->Get(static_cast<int>(middle))->IsNil() ? high : low) = middle;
    }
    return static_cast<int>(low);
}

}  // namespace

bool Table::HasNodes() const {
    return m_Nodes != &s_NoNodes;
}

const Value* Table::Get(const Value& key) const {
    if (key.IsString()) return Get(key.AsString());
    if (key.IsNil()) return &g_Nil;
    int index = GetArrayIndex(key);
    if (index > 0 && index <= m_ArraySize) return m_Array + index - 1;
    return Search(this, key);
}

Table* NewTable(State& L, int arraySize, int nodeCount) {
    Table* table = L.GetMachine().NewObject<Table>(Type::Table);
    table->m_Metatable = nullptr;
    table->m_Absent = 0xFF;
    table->m_Array = nullptr;
    table->m_ArraySize = 0;
    table->m_GcList = nullptr;
    table->m_Flags = L.TakeHashState() ? Table::kHashed : 0;
    SetNodes(L, table, 0);
    if (arraySize) SetArraySize(L, table, arraySize);
    if (nodeCount) SetNodes(L, table, nodeCount);
    return table;
}

void FreeTable(Machine& machine, Table* table) {
    if (table->HasNodes()) machine.FreeArray(table->m_Nodes, table->CountNodes());
    machine.FreeArray(table->m_Array, table->m_ArraySize);
    machine.FreeBytes(table, sizeof(Table));
}

Value* SetSlot(State& L, Table* table, String* key) {
    table->m_Absent = 0;
    const Value* found = table->Get(key);
    if (found != &g_Nil) return const_cast<Value*>(found);
    return AddKey(L, table, Value::Of(key));
}

Value* SetSlot(State& L, Table* table, int key) {
    table->m_Absent = 0;
    const Value* found = table->Get(key);
    if (found != &g_Nil) return const_cast<Value*>(found);
    return AddKey(L, table, Value::Number(key));
}

Value* SetSlot(State& L, Table* table, const Value& key) {
    table->m_Absent = 0;
    const Value* found = table->Get(key);
    if (found != &g_Nil) return const_cast<Value*>(found);
    if (key.IsNil()) L.RunError("table index is nil");
    if (key.IsNumber() && key.m_Number != key.m_Number) L.RunError("table index is NaN");
    return AddKey(L, table, key);
}

void ResizeArray(State& L, Table* table, int size) {
    Resize(L, table, size, table->HasNodes() ? table->CountNodes() : 0);
}

bool Next(State& L, Table* table, Value* key) {
    int place = FindPlace(L, table, *key);
    for (; place < table->m_ArraySize; place++) {
        if (table->m_Array[place].IsNil()) continue;
        key[0] = Value::Number(place + 1);
        key[1] = table->m_Array[place];
        return true;
    }
    int count = table->CountNodes();
    int first = place -= table->m_ArraySize;
    for (; place < count; place++) {
        const Node& node = table->m_Nodes[table->IsHashed() ? place : count - 1 - place];
        if (node.m_Value.IsNil()) continue;
        key[0] = node.m_Key.Get();
        key[1] = node.m_Value;
        L.Charge((place - first) / 16 + (table->IsHashed() ? 0 : place / 16));
        return true;
    }
    L.Charge((place - first) / 16);
    return false;
}

int GetLength(const Table* table) {
    unsigned high = table->m_ArraySize;
    if (high > 0 && table->m_Array[high - 1].IsNil()) {
        unsigned low = 0;
        while (high - low > 1) {
            unsigned middle = (low + high) / 2;
            (table->m_Array[middle - 1].IsNil() ? high : low) = middle;
        }
        return static_cast<int>(low);
    }
    return table->HasNodes() ? SearchBorder(table, high) : static_cast<int>(high);
}

}  // namespace Korvel::TextForm

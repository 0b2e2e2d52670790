// Blocks of bytes in the text form's interpreter: the userdata that stands for one, and what texts
// make them with.
#include <cstdlib>
#include <cstring>
#include <new>
#include <utility>

#include "core/ScriptTextInternal.h"
#include "textform/Chars.h"
#include "textform/Interpreter.h"

namespace Korvel {

using namespace TextForm;

namespace {

constexpr const char kTypeName[] = "MemBlock";

// The interpreter's heap has it, so that its limit counts it and its end frees it. The bytes stand
// behind the record.
struct Block {
    size_t m_Size;

    unsigned char* GetBytes() { return reinterpret_cast<unsigned char*>(this + 1); }
};

// What a userdata holds; null once the finaliser has been called, which a text can do.
Block*& GetPointer(Userdata* userdata) {
    return *static_cast<Block**>(userdata->GetData());
}

bool IsBlock(State& L, const Value& value) {
    if (!value.Is(Type::Userdata)) return false;
    Machine& machine = L.GetMachine();
    const Value* metatable = machine.m_Registry->Get(machine.NewString(kTypeName));
    return metatable->IsTable() && value.AsUserdata()->m_Metatable == metatable->AsTable();
}

// The block of argument 1, or null.
Block* GetBlock(State& L) {
    return IsBlock(L, L.Arg(1)) ? GetPointer(L.Arg(1).AsUserdata()) : nullptr;
}

// The byte that a number key names, or null.
unsigned char* FindByte(State& L, Block* block) {
    if (!block || !L.Arg(2).IsNumber()) return nullptr;
    auto index = static_cast<uint64_t>(TextForm::ToInt64(L.Arg(2).m_Number));
    return index - 1 < block->m_Size ? block->GetBytes() + index - 1 : nullptr;
}

// Pushes a block of zeros; false when there is no memory.
bool PushBlock(State& L, size_t size) {
    L.Charge(size / 64);
    void* memory = L.GetMachine().m_Heap.Allocate(sizeof(Block) + size);
    if (!memory) return false;
    auto* block = new (memory) Block{size};
    memset(block->GetBytes(), 0, size);
    lua_pushobject(L, block, kTypeName);
    return true;
}

int BlockGc(State& L) {
    if (!IsBlock(L, L.Arg(1))) return 0;
    Block* block = std::exchange(GetPointer(L.Arg(1).AsUserdata()), nullptr);
    if (block) L.GetMachine().m_Heap.Free(block, sizeof(Block) + block->m_Size);
    return 0;
}

int BlockToString(State& L) {
    Block* block = GetBlock(L);
    if (block) {
        L.PushFormat("MemBlock (%f bytes)", static_cast<double>(block->m_Size));
    } else {
        L.PushNil();
    }
    return 1;
}

int BlockIndex(State& L) {
    Block* block = GetBlock(L);
    const Value key = L.Arg(2);
    if (const unsigned char* byte = FindByte(L, block)) {
        L.PushNumber(*byte);
    } else if (block && key.IsString() && key.AsString()->GetView() == "Size") {
        L.PushNumber(static_cast<double>(block->m_Size));
    } else {
        L.PushNil();
    }
    return 1;
}

int BlockNewIndex(State& L) {
    if (unsigned char* byte = FindByte(L, GetBlock(L))) {
        double number = 0;
        State::ToNumber(L.Arg(3), number);
        *byte = static_cast<unsigned char>(TextForm::ToInt64(number));
    }
    return 0;
}

int HexDigit(char c) {
    return c <= '9' ? c - '0' : (c | 0x20) - 'a' + 10;
}

// Reads the next number of a text. Nearly all are two digits and a separator.
bool ReadToken(const char*& text, unsigned char& byte) {
    const char* p = text;
    auto at = [&p](int i) { return static_cast<unsigned char>(p[i]); };
    while (IsSpace(at(0))) p++;
    if (IsHexDigit(at(0)) && IsHexDigit(at(1)) && (IsSpace(at(2)) || !at(2))) {
        byte = static_cast<unsigned char>(HexDigit(p[0]) << 4 | HexDigit(p[1]));
        text = p + 2;
        return true;
    }
    char* end;
    long number = strtol(p, &end, 16);
    if (end == p) return false;
    byte = static_cast<unsigned char>(number);
    text = end;
    return true;
}

int HexData(State& L) {
    if (!L.Arg(1).IsString()) return 0;
    const String* string = L.Arg(1).AsString();
    L.Charge(string->m_Length / 16);
    size_t size = 0;
    unsigned char byte;
    for (const char* p = string->GetText(); ReadToken(p, byte);) size++;
    if (!PushBlock(L, size)) L.GetMachine().RaiseMemoryError();  // nothing would be data lost
    unsigned char* to = GetPointer(L.m_Top[-1].AsUserdata())->GetBytes();
    for (const char* p = string->GetText(); ReadToken(p, byte);) *to++ = byte;
    return 1;
}

int NewMemBlock(State& L) {
    double size = 0;
    State::ToNumber(L.Arg(1), size);
    if (!(size >= 1 && size <= UINT32_MAX)) return 0;
    return PushBlock(L, static_cast<size_t>(size)) ? 1 : 0;
}

constexpr NativeEntry kMethods[] = {
    {"__gc", BlockGc},
    {"__tostring", BlockToString},
    {"__index", BlockIndex},
    {"__newindex", BlockNewIndex},
};
constexpr NativeEntry kConstructors[] = {{"HexData", HexData}, {"MemBlock", NewMemBlock}};

// A table of the library's own; the one-shot is for what the text makes.
Table* PushOwnTable(State& L) {
    uint8_t state = std::exchange(L.m_HashState, uint8_t{1});
    Table* table = L.PushTable();
    L.m_HashState = state;
    return table;
}

// The userdata by pointer, weakly held. Left on the stack.
Table* PushKnownObjects(State& L) {
    const Value key = Value::LightUserdata(reinterpret_cast<void*>(lua_pushobject));
    Table* registry = L.GetMachine().m_Registry;
    if (const Value* known = registry->Get(key); known->IsTable()) {
        L.Push(*known);
        return known->AsTable();
    }
    Table* table = PushOwnTable(L);
    table->m_Metatable = table;
    L.PushString("kv");
    L.SetField(table, "__mode", L.m_Top[-1]);
    L.Pop();
    L.SetRaw(registry, key, Value::Of(table));
    return table;
}

}  // namespace

void register_memblock(State& L) {
    Table* metatable = PushOwnTable(L);
    Register(L, metatable, kMethods);
    L.SetField(L.GetMachine().m_Registry, kTypeName, Value::Of(metatable));
    L.Pop();
    Register(L, L.m_Globals, kConstructors);
}

bool GetTextMemBlock(State& L, const Value& value, MemBlock& block) {
    if (!IsBlock(L, value)) return false;
    Block* held = GetPointer(value.AsUserdata());
    block = held ? MemBlock(held->GetBytes(), static_cast<uint32_t>(held->m_Size)) : MemBlock();
    return true;
}

void lua_pushobject(State& L, void* ptr, const char* typeName) {
    L.NeedStack(4);
    Table* known = PushKnownObjects(L);
    const Value key = Value::LightUserdata(ptr);
    // A pointer may come again when what it pointed to is gone, but not what stood for it.
    if (const Value* found = known->Get(key);
        found->Is(Type::Userdata) && *static_cast<void**>(found->AsUserdata()->GetData()) == ptr) {
        L.m_Top[-1] = *found;
        return;
    }
    Userdata* userdata = NewUserdata(L.GetMachine(), sizeof ptr, L.m_Globals);
    memcpy(userdata->GetData(), &ptr, sizeof ptr);
    L.Push(Value::Of(static_cast<Object*>(userdata)));
    L.PushField(L.GetMachine().m_Registry, typeName);
    if (L.m_Top[-1].IsTable()) userdata->m_Metatable = L.m_Top[-1].AsTable();
    L.Pop();
    L.SetRaw(known, key, L.m_Top[-1]);
    L.m_Top[-2] = L.m_Top[-1];
    L.Pop();
}

}  // namespace Korvel

// From values of the text form's interpreter to ours.
#include <cstring>

#include "core/NumbersInternal.h"
#include "core/ScriptTextInternal.h"
#include "core/ScriptValInternal.h"
#include "textform/Chunk.h"
#include "textform/Interpreter.h"
#include "textform/Numbers.h"

namespace Korvel {

using TextForm::State;
using TextForm::Value;

namespace {

struct DumpBuffer {
    DumpBuffer() = default;
    DumpBuffer(const DumpBuffer&) = delete;
    DumpBuffer& operator=(const DumpBuffer&) = delete;
    ~DumpBuffer() { g_ReusePoolMgr.Free(m_Bytes); }

    char* m_Bytes = nullptr;
    size_t m_Size = 0;
    size_t m_Room = 0;
};

// The entries of a table while they are read. However the reading ends, the table gets them:
// number keys first, in rising order, then the others in the order of the walk.
class Entries {
public:
    explicit Entries(ScriptVal& table) : m_Table(table) {}
    Entries(const Entries&) = delete;
    Entries& operator=(const Entries&) = delete;
    ~Entries() {
        *m_NumbersEnd = m_Others;
        m_Table.SetTable(m_Numbers);
        m_Table.m_Flags |= m_Flags;  // last: the table may become read-only by it
    }

    // A new entry, whose key is the number or, if that is another value, still to be set. Null
    // without memory.
    TableEntry* Add(const Value& key) {
        if (key.IsNumber()) return Link(NewEntry(key.m_Number), m_NumbersEnd);
        return Link(NewEntry(), m_OthersEnd);
    }
    void AddFlags(uint32_t flags) { m_Flags |= flags & ~SVF_TypeMask; }

private:
    static TableEntry* Link(TableEntry* entry, TableEntry**& end) {
        if (!entry) return nullptr;
        *end = entry;
        end = &entry->m_Next;
        return entry;
    }

    ScriptVal& m_Table;
    uint32_t m_Flags = 0;
    TableEntry* m_Numbers = nullptr;
    TableEntry** m_NumbersEnd = &m_Numbers;
    TableEntry* m_Others = nullptr;
    TableEntry** m_OthersEnd = &m_Others;
};

// All that it fills is nil before. Each step is false without memory.
class Converter {
public:
    explicit Converter(State& L)
        : m_State(L),
          m_IsLimited(L.GetMachine().m_IsLimited),
          m_AllowedFlags(m_IsLimited ? ~(SVF_ReadOnly | SVF_FromWire) : ~0u),
          m_ConstructorKey(L.GetMachine().NewString("__ctor")),
          m_FlagsKey(L.GetMachine().NewString("__flags")) {}

    bool Convert(const Value& value, ScriptVal& out, int depth) {
        switch (value.m_Type) {
            case TextForm::Type::Number:
                out = value.m_Number;
                return true;
            case TextForm::Type::String:
                return ConvertString(value.AsString(), out);
            case TextForm::Type::Table:
                return ConvertTable(value.AsTable(), out, depth);
            case TextForm::Type::Nil:
                return true;
            case TextForm::Type::Boolean:
                out = value.m_Boolean != 0;
                return true;
            case TextForm::Type::Function:
                return m_IsLimited || ConvertFunction(value.AsFunction(), out);
            default:
                return ConvertBlock(value, out);
        }
    }

private:
    static bool BeginsLikeCell(const TextForm::String* string) {
        return TextCell::IsCell(string->GetText());
    }
    void RefuseName(const TextForm::String* name) {
        if (BeginsLikeCell(name)) m_State.Error("A key or constructor begins with byte 255.");
    }

    bool ConvertString(const TextForm::String* string, ScriptVal& out);
    bool ConvertFunction(TextForm::Closure* function, ScriptVal& out);
    bool ConvertBlock(const Value& value, ScriptVal& out);
    bool SetBlock(const MemBlock& block, ScriptVal& out);
    bool ConvertTable(const TextForm::Table* table, ScriptVal& out, int depth);
    bool ConvertEntry(const Value& key, const Value& value, Entries& entries, int depth);
    bool ReadConstructor(const Value& name, ScriptVal& table);
    bool ReadEntry(const Value& key, const Value& value, ScriptVal& table, Entries& entries,
                   int depth);

    State& m_State;
    bool m_IsLimited;
    uint32_t m_AllowedFlags;  // that a text may set by itself
    const TextForm::String* m_ConstructorKey;
    const TextForm::String* m_FlagsKey;
};

bool Converter::SetBlock(const MemBlock& block, ScriptVal& out) {
    m_State.Charge(block.m_Size / 64);
    out.Set(SV_MemBlock, &block);
    return !out.IsNil();
}

// No text has a zero within, or begins like a cell.
bool Converter::ConvertString(const TextForm::String* string, ScriptVal& out) {
    const char* text = string->GetText();
    size_t length = string->m_Length;
    if (BeginsLikeCell(string) || memchr(text, 0, length)) {
        if (length > UINT32_MAX) return false;
        return SetBlock({const_cast<char*>(text), static_cast<uint32_t>(length)}, out);
    }
    m_State.Charge(length / 64);
    const char* cell = TextCell::New(text, length);
    if (!cell) return false;
    AdoptText(out, SV_String, cell, length);
    return true;
}

// A native function has no code.
bool Converter::ConvertFunction(TextForm::Closure* function, ScriptVal& out) {
    DumpBuffer dump;
    if (!function->IsNative() &&
        TextForm::Dump(AsScript(function)->m_Prototype, mywriter, &dump) != 0) {
        return false;
    }
    if (dump.m_Size > UINT32_MAX) return false;
    ScriptVal::BlockPayload code{dump.m_Bytes, static_cast<uint32_t>(dump.m_Size), 0};
    out.Set(SV_Code, &code);
    return !out.IsNil();
}

bool Converter::ConvertBlock(const Value& value, ScriptVal& out) {
    MemBlock block;
    if (!GetTextMemBlock(m_State, value, block)) {
        m_State.Error("Unsupported type for custom data!");
    }
    return SetBlock(block, out);
}

bool Converter::ReadConstructor(const Value& name, ScriptVal& table) {
    char number[TextForm::kNumberSize];
    const char* text = number;
    if (name.IsString()) {
        RefuseName(name.AsString());
        m_State.Charge(name.AsString()->m_Length / 64);
        text = name.AsString()->GetText();
    } else if (name.IsNumber()) {
        TextForm::WriteNumber(number, name.m_Number);
    } else {
        return true;
    }
    table.SetConstructor(text);
    return table.GetConstructor() != nullptr;
}

bool Converter::ConvertEntry(const Value& key, const Value& value, Entries& entries, int depth) {
    m_State.Charge(1);
    if (m_IsLimited && (key.IsFunction() || value.IsFunction())) return true;
    if (key.IsString()) RefuseName(key.AsString());
    TableEntry* entry = entries.Add(key);
    if (!entry) return false;
    if (!key.IsNumber() && !Convert(key, entry->m_Key, depth + 1)) return false;
    return Convert(value, entry->m_Value, depth + 1);
}

bool Converter::ReadEntry(const Value& key, const Value& value, ScriptVal& table, Entries& entries,
                          int depth) {
    if (key.IsString() && key.AsString() == m_ConstructorKey) return ReadConstructor(value, table);
    if (key.IsString() && key.AsString() == m_FlagsKey) {
        if (value.IsNumber()) entries.AddFlags(Low32(value.m_Number) & m_AllowedFlags);
        return true;
    }
    return ConvertEntry(key, value, entries, depth);
}

// The nodes of an ordered table are walked downward.
bool Converter::ConvertTable(const TextForm::Table* from, ScriptVal& out, int depth) {
    using TextForm::Table;
    if (depth >= kMaxNesting) m_State.Error("Table nested too deeply.");
    out.Set(SV_Table, nullptr);
    Entries entries(out);
    if (!from->IsHashed()) entries.AddFlags(SVF_Ordered);
    if (!(from->m_Flags & Table::kListItems)) entries.AddFlags(SVF_ExplicitKeys);
    if (from->m_Flags & Table::kCompact) entries.AddFlags(SVF_Compact);
    for (int i = 0; i < from->m_ArraySize; i++) {
        const Value& value = from->m_Array[i];
        if (value.IsNil()) continue;
        if (!ConvertEntry(Value::Number(i + 1), value, entries, depth)) return false;
    }
    if (!from->HasNodes()) return true;
    int count = from->CountNodes();
    m_State.Charge(count / 16);
    for (int i = 0; i < count; i++) {
        const TextForm::Node& node = from->m_Nodes[from->IsHashed() ? i : count - 1 - i];
        if (node.m_Value.IsNil()) continue;
        if (!ReadEntry(node.m_Key.Get(), node.m_Value, out, entries, depth)) return false;
    }
    return true;
}

}  // namespace

int mywriter(const void* data, size_t size, void* state) {
    auto& buffer = *static_cast<DumpBuffer*>(state);
    if (size > buffer.m_Room - buffer.m_Size) {
        size_t room = buffer.m_Room ? buffer.m_Room : 32;
        while (room - buffer.m_Size < size) room *= 2;
        auto* bytes = static_cast<char*>(g_ReusePoolMgr.Alloc(room));
        if (!bytes) return 1;
        if (buffer.m_Size) memcpy(bytes, buffer.m_Bytes, buffer.m_Size);
        g_ReusePoolMgr.Free(buffer.m_Bytes);
        buffer.m_Bytes = bytes;
        buffer.m_Room = room;
    }
    memcpy(buffer.m_Bytes + buffer.m_Size, data, size);
    buffer.m_Size += size;
    return 0;
}

bool _old_FromLua(State& L, int index, ScriptVal& out, bool) {
    const Value& from = index < 0 ? L.m_Top[index] : L.Arg(index);
    ScriptVal value;
    bool isWhole = Converter(L).Convert(from, value, 0);
    if (!out.IsReadOnly()) out = std::move(value);
    return isWhole;
}

}  // namespace Korvel

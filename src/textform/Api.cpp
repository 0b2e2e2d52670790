// The operations of native code: arguments, results, fields.
#include <cstdio>
#include <string>

#include "textform/Chunk.h"
#include "textform/Lexer.h"
#include "textform/Numbers.h"
#include "textform/Parser.h"
#include "textform/State.h"
#include "textform/Vm.h"

namespace Korvel::TextForm {

constinit const Value g_None(Type::None, nullptr);

const char* GetTypeName(Type type) {
    static constexpr const char* kNames[] = {"no value", "nil",    "boolean", "userdata",
                                             "number",   "string", "table",   "function",
                                             "userdata", "thread", "proto",   "upval"};
    return kNames[static_cast<int>(type) + 1];
}

// ---- Stack

const Value& State::Arg(int i) const {
    const Value* place = m_Base + i - 1;
    return place < m_Top ? *place : g_None;
}

const Value& State::GetUpValue(int i) const {
    NativeClosure* c = AsNative(m_Call->m_Function->AsFunction());
    return i <= c->m_UpValueCount ? c->GetUpValues()[i - 1] : g_None;
}

String* State::PushString(std::string_view text) {
    String* string = m_Machine->NewString(text);
    Push(Value::Of(string));
    return string;
}

const char* State::PushFormatV(const char* format, va_list args) {
    int count = 0;
    auto add = [&](std::string_view piece) {
        NeedStack(2);
        PushString(piece);
        count++;
    };
    const char* mark;
    for (; (mark = strchr(format, '%')); format = mark + 2) {
        add({format, static_cast<size_t>(mark - format)});
        char buffer[kNumberSize];
        switch (mark[1]) {
            case 's': {
                const char* text = va_arg(args, const char*);
                add(text ? text : "(null)");
                break;
            }
            case 'c':
                buffer[0] = static_cast<char>(va_arg(args, int));
                add({buffer, buffer[0] != 0});
                break;
            case 'd':
                add({buffer, WriteNumber(buffer, va_arg(args, int))});
                break;
            case 'f':
                add({buffer, WriteNumber(buffer, va_arg(args, double))});
                break;
            case 'p':
                add({buffer, static_cast<size_t>(
                                 snprintf(buffer, sizeof buffer, "%p", va_arg(args, void*)))});
                break;
            default:
                add({mark + 1, 1});
        }
    }
    add(format);
    Concat(*this, count);
    return m_Top[-1].AsString()->GetText();
}

const char* State::PushFormat(const char* format, ...) {
    va_list args;
    va_start(args, format);
    const char* text = PushFormatV(format, args);
    va_end(args);
    return text;
}

void State::PushFunction(NativeFunction function, int upValueCount) {
    Closure* running =
        m_Call->m_Function->IsFunction() ? m_Call->m_Function->AsFunction() : nullptr;
    NativeClosure* c = NewNativeClosure(*m_Machine, function, upValueCount,
                                        running ? running->m_Environment : m_Globals);
    m_Top -= upValueCount;
    for (int i = 0; i < upValueCount; i++) c->GetUpValues()[i] = m_Top[i];
    Push(Value::Of(static_cast<Closure*>(c)));
}

Table* State::PushTable(int arraySize, int nodeCount) {
    Table* table = NewTable(*this, arraySize, nodeCount);
    Push(Value::Of(table));
    return table;
}

void State::SetTop(int count) {
    Value* top = m_Base + count;
    while (m_Top < top) PushNil();
    m_Top = top;
}

void State::Insert(int i) {
    Value* place = m_Base + i - 1;
    const Value value = m_Top[-1];
    for (Value* p = m_Top - 1; p > place; p--) *p = p[-1];
    *place = value;
}

// ---- Arguments

bool State::ToNumber(const Value& value, double& number) {
    if (value.IsNumber()) {
        number = value.m_Number;
        return true;
    }
    return value.IsString() && ReadNumberText(value.AsString()->GetView(), number);
}

bool State::ToString(Value* place) {
    if (place->IsString()) return true;
    if (!place->IsNumber()) return false;
    char buffer[kNumberSize];
    size_t length = WriteNumber(buffer, place->m_Number);
    *place = Value::Of(m_Machine->NewString(buffer, length));
    return true;
}

double State::CheckNumber(int i) {
    double number;
    if (!ReadNumber(Arg(i), number)) TypeError(i, "number");
    return number;
}

int64_t State::CheckInteger(int i) {
    return ToInt64(CheckNumber(i));
}

int64_t State::OptInteger(int i, int64_t otherwise) {
    return IsNoneOrNil(i) ? otherwise : CheckInteger(i);
}

double State::OptNumber(int i, double otherwise) {
    return IsNoneOrNil(i) ? otherwise : CheckNumber(i);
}

String* State::CheckString(int i) {
    if (GetArgType(i) == Type::None || !ToString(m_Base + i - 1)) TypeError(i, "string");
    return Arg(i).AsString();
}

std::string_view State::OptString(int i, std::string_view otherwise) {
    return IsNoneOrNil(i) ? otherwise : CheckString(i)->GetView();
}

Table* State::CheckTable(int i) {
    CheckType(i, Type::Table);
    return Arg(i).AsTable();
}

void State::CheckType(int i, Type type) {
    if (GetArgType(i) != type) TypeError(i, GetTypeName(type));
}

void State::CheckAny(int i) {
    if (GetArgType(i) == Type::None) ArgError(i, "value expected");
}

int State::CheckOption(int i, const char* otherwise, const char* const* options) {
    std::string_view name = otherwise ? OptString(i, otherwise) : CheckString(i)->GetView();
    for (int option = 0; options[option]; option++) {
        if (name == options[option]) return option;
    }
    ArgError(i, PushFormat("invalid option '%s'", std::string(name).c_str()));
}

// ---- Fields

void State::SetRaw(Table* table, const Value& key, const Value& value) {
    ChargeAccess(table);
    *SetSlot(*this, table, key) = value;
    m_Machine->BarrierBack(table, value);
}

void State::SetRaw(Table* table, int key, const Value& value) {
    ChargeAccess(table);
    *SetSlot(*this, table, key) = value;
    m_Machine->BarrierBack(table, value);
}

void State::SetField(Table* table, std::string_view name, const Value& value) {
    *SetSlot(*this, table, m_Machine->NewString(name)) = value;
    m_Machine->BarrierBack(table, value);
}

void State::PushField(Table* table, std::string_view name) {
    Push(*table->Get(m_Machine->NewString(name)));
}

bool State::GetMetaField(int i, std::string_view event) {
    Table* metatable = m_Machine->GetMetatable(Arg(i));
    if (!metatable) return false;
    const Value* field = metatable->Get(m_Machine->NewString(event));
    if (field->IsNil()) return false;
    Push(*field);
    return true;
}

bool State::CallMeta(int i, std::string_view event) {
    if (!GetMetaField(i, event)) return false;
    Push(Arg(i));
    Call(1, 1);
    return true;
}

// ---- Chunks

Status State::Load(ChunkReader reader, void* readerState, const char* chunkName, bool allowBinary) {
    return RunProtected(
        [&] {
            Machine::GcPause pause(*m_Machine);
            Source source(*this, reader, readerState);
            bool isBinary = source.Peek() == kBinaryMark;
            if (isBinary && !allowBinary) Error("precompiled chunks are not allowed here");
            Prototype* p =
                isBinary ? Undump(*this, source, chunkName) : Parse(*this, source, chunkName);
            ScriptClosure* c = NewScriptClosure(*m_Machine, p, m_Globals);
            for (int i = 0; i < c->m_UpValueCount; i++) {
                c->GetUpValues()[i] = NewClosedUpValue(*m_Machine);
            }
            Push(Value::Of(static_cast<Closure*>(c)));
        },
        m_Top, m_Handler);
}

Status State::LoadBuffer(std::string_view text, const char* chunkName, bool allowBinary) {
    auto reader = [](State&, void* state, size_t* size) -> const char* {
        auto* rest = static_cast<std::string_view*>(state);
        *size = rest->size();
        const char* piece = rest->data();
        *rest = {};
        return *size ? piece : nullptr;
    };
    return Load(reader, &text, chunkName, allowBinary);
}

}  // namespace Korvel::TextForm

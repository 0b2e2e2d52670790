// Operations on values: metamethods, conversions, comparisons, concatenation.
#include <algorithm>
#include <cmath>
#include <utility>

#include "textform/Numbers.h"
#include "textform/Vm.h"

namespace Korvel::TextForm {

namespace {

constexpr int kMaxMetaLoop = 100;

// Calls a metamethod with its operands; one result stays on the top.
void CallMethod(State& L, const Value& method, const Value& a, const Value& b) {
    Value* top = L.m_Top;
    top[0] = method;
    top[1] = a;
    top[2] = b;
    L.m_Top += 3;
    L.NeedStack(0);
    L.CallAt(L.m_Top - 3, 1);
}

void CallMethodInto(State& L, const Value& method, const Value& a, const Value& b, Value* result) {
    ptrdiff_t offset = L.GetOffset(result);
    CallMethod(L, method, a, b);
    *L.GetPlace(offset) = *--L.m_Top;
}

Event GetEvent(Op op) {
    switch (op) {
        case Op::Add:
            return Event::Add;
        case Op::Sub:
            return Event::Sub;
        case Op::Mul:
            return Event::Mul;
        case Op::Div:
            return Event::Div;
        case Op::Mod:
            return Event::Mod;
        case Op::Pow:
            return Event::Pow;
        default:
            return Event::Unm;
    }
}

// The metamethod of the first operand that has one; null without.
const Value* GetBinaryMethod(State& L, const Value& a, const Value& b, Event event) {
    const Value* method = L.GetMachine().GetMeta(a, event);
    if (method->IsNil()) method = L.GetMachine().GetMeta(b, event);
    return method->IsNil() ? nullptr : method;
}

enum class Answer : uint8_t { No, Yes, NoMethod };

// Orders by metamethod, if both operands have the same.
Answer AskOrder(State& L, const Value& a, const Value& b, Event event) {
    const Value* method = L.GetMachine().GetMeta(a, event);
    if (method->IsNil() || !RawEquals(*method, *L.GetMachine().GetMeta(b, event))) {
        return Answer::NoMethod;
    }
    CallMethod(L, *method, a, b);
    return (--L.m_Top)->IsFalse() ? Answer::No : Answer::Yes;
}

// What is common to both metatables; null if nothing.
const Value* GetEqualityMethod(State& L, Table* a, Table* b) {
    Machine& machine = L.GetMachine();
    const Value* first = machine.GetFastMeta(a, Event::Eq);
    if (!first || a == b) return first;
    const Value* second = machine.GetFastMeta(b, Event::Eq);
    return second && RawEquals(*first, *second) ? first : nullptr;
}

bool IsText(const Value& value) {
    return value.IsString() || value.IsNumber();
}

// Joins the `count` topmost strings into the lowest one's place.
void JoinStrings(State& L, Value* top, int count) {
    size_t total = 0;
    for (int i = 1; i <= count; i++) {
        size_t length = top[-i].AsString()->m_Length;
        if (length >= SIZE_MAX / 4 - total) L.RunError("string length overflow");
        total += length;
    }
    L.Charge(total / 64);
    char* buffer = L.GetMachine().NeedScratch(total);
    char* end = buffer;
    for (int i = count; i > 0; i--) {
        String* piece = top[-i].AsString();
        memcpy(end, piece->GetText(), piece->m_Length);
        end += piece->m_Length;
    }
    top[-count] = Value::Of(L.GetMachine().NewString(buffer, total));
}

}  // namespace

char* Machine::NeedScratch(size_t size) {
    if (size > m_ScratchSize) {
        size_t wanted = std::max(size, m_ScratchSize * 2);
        FreeArray(std::exchange(m_Scratch, nullptr), std::exchange(m_ScratchSize, 0));
        m_Scratch = NewArray<char>(wanted);
        m_ScratchSize = wanted;
    }
    return m_Scratch;
}

// ---- Metatables

Table* Machine::GetMetatable(const Value& value) const {
    switch (value.m_Type) {
        case Type::None:
            return nullptr;
        case Type::Table:
            return value.AsTable()->m_Metatable;
        case Type::Userdata:
            return value.AsUserdata()->m_Metatable;
        default:
            return m_TypeMetatables[static_cast<int>(value.m_Type)];
    }
}

const Value* Machine::GetMeta(const Value& value, Event event) const {
    Table* metatable = GetMetatable(value);
    return metatable ? metatable->Get(GetEventName(event)) : &g_Nil;
}

const Value* Machine::FindFastMeta(Table* metatable, Event event) {
    const Value* method = metatable->Get(GetEventName(event));
    if (!method->IsNil()) return method;
    metatable->m_Absent |= static_cast<uint8_t>(1 << static_cast<int>(event));
    return nullptr;
}

void State::GetIndex(const Value& object, const Value& key, Value* result) {
    const Value keyCopy = key;
    Value holder = object;
    const Value* named = &object;  // for a message, as long as it is the operand itself
    for (int i = 0; i < kMaxMetaLoop; i++) {
        const Value* method;
        if (holder.IsTable()) {
            Table* table = holder.AsTable();
            ChargeAccess(table);
            const Value* found = table->Get(keyCopy);
            if (!found->IsNil()) {
                *result = *found;
                return;
            }
            method = m_Machine->GetFastMeta(table->m_Metatable, Event::Index);
            if (!method) {
                *result = g_Nil;
                return;
            }
        } else {
            method = m_Machine->GetMeta(holder, Event::Index);
            if (method->IsNil()) OperandError(named, "index");
        }
        if (method->IsFunction()) {
            CallMethodInto(*this, *method, holder, keyCopy, result);
            return;
        }
        holder = *method;
        named = &holder;
    }
    RunError("loop in gettable");
}

void State::SetIndex(const Value& object, const Value& key, const Value& value) {
    const Value keyCopy = key;
    const Value valueCopy = value;
    Value holder = object;
    const Value* named = &object;
    for (int i = 0; i < kMaxMetaLoop; i++) {
        const Value* method;
        if (holder.IsTable()) {
            Table* table = holder.AsTable();
            ChargeAccess(table);
            Value* slot = SetSlot(*this, table, keyCopy);
            method = slot->IsNil() ? m_Machine->GetFastMeta(table->m_Metatable, Event::NewIndex)
                                   : nullptr;
            if (!method) {
                *slot = valueCopy;
                m_Machine->BarrierBack(table, valueCopy);
                return;
            }
        } else {
            method = m_Machine->GetMeta(holder, Event::NewIndex);
            if (method->IsNil()) OperandError(named, "index");
        }
        if (method->IsFunction()) {
            Value* top = m_Top;
            top[0] = *method;
            top[1] = holder;
            top[2] = keyCopy;
            top[3] = valueCopy;
            m_Top += 4;
            NeedStack(0);
            CallAt(m_Top - 4, 0);
            return;
        }
        holder = *method;
        named = &holder;
    }
    RunError("loop in settable");
}

// ---- Arithmetic and comparison

double Calculate(Op op, double a, double b) {
    switch (op) {
        case Op::Add:
            return a + b;
        case Op::Sub:
            return a - b;
        case Op::Mul:
            return a * b;
        case Op::Div:
            return a / b;
        case Op::Mod:
            return FloorMod(a, b);
        case Op::Pow:
            return std::pow(a, b);
        default:
            return -a;
    }
}

void Arithmetic(State& L, Op op, const Value* a, const Value* b, Value* result) {
    double first;
    double second;
    if (L.ReadNumber(*a, first) && L.ReadNumber(*b, second)) {
        *result = Value::Number(Calculate(op, first, second));
        return;
    }
    const Value* method = GetBinaryMethod(L, *a, *b, GetEvent(op));
    if (!method) L.ArithmeticError(a, b);
    CallMethodInto(L, *method, *a, *b, result);
}

static int CompareText(State& L, const String* a, const String* b) {
    size_t common = std::min(a->m_Length, b->m_Length);
    L.Charge(common / 256);
    int order = memcmp(a->GetText(), b->GetText(), common);
    if (order) return order;
    return a->m_Length < b->m_Length ? -1 : a->m_Length > b->m_Length;
}

bool LessThan(State& L, const Value* a, const Value* b) {
    if (a->m_Type != b->m_Type) L.CompareError(a, b);
    if (a->IsNumber()) return a->m_Number < b->m_Number;
    if (a->IsString()) return CompareText(L, a->AsString(), b->AsString()) < 0;
    Answer answer = AskOrder(L, *a, *b, Event::Lt);
    if (answer == Answer::NoMethod) L.CompareError(a, b);
    return answer == Answer::Yes;
}

bool LessEqual(State& L, const Value* a, const Value* b) {
    if (a->m_Type != b->m_Type) L.CompareError(a, b);
    if (a->IsNumber()) return a->m_Number <= b->m_Number;
    if (a->IsString()) return CompareText(L, a->AsString(), b->AsString()) <= 0;
    Answer answer = AskOrder(L, *a, *b, Event::Le);
    if (answer != Answer::NoMethod) return answer == Answer::Yes;
    answer = AskOrder(L, *b, *a, Event::Lt);
    if (answer == Answer::NoMethod) L.CompareError(a, b);
    return answer == Answer::No;
}

bool EqualValues(State& L, const Value* a, const Value* b) {
    if (a->m_Type != b->m_Type) return false;
    if (RawEquals(*a, *b)) return true;
    const Value* method;
    if (a->IsTable()) {
        method = GetEqualityMethod(L, a->AsTable()->m_Metatable, b->AsTable()->m_Metatable);
    } else if (a->Is(Type::Userdata)) {
        method = GetEqualityMethod(L, a->AsUserdata()->m_Metatable, b->AsUserdata()->m_Metatable);
    } else {
        return false;
    }
    if (!method) return false;
    CallMethod(L, *method, *a, *b);
    return !(--L.m_Top)->IsFalse();
}

bool State::Equals(const Value& a, const Value& b) {
    return EqualValues(*this, &a, &b);
}

bool State::Less(const Value& a, const Value& b) {
    return LessThan(*this, &a, &b);
}

void GetLengthOf(State& L, const Value* operand, Value* result) {
    if (operand->IsTable()) {
        L.ChargeAccess(operand->AsTable());
        *result = Value::Number(GetLength(operand->AsTable()));
    } else if (operand->IsString()) {
        *result = Value::Number(static_cast<double>(operand->AsString()->m_Length));
    } else {
        const Value* method = L.GetMachine().GetMeta(*operand, Event::Len);
        if (method->IsNil()) L.OperandError(operand, "get length of");
        CallMethodInto(L, *method, *operand, g_Nil, result);
    }
}

// From right to left, as many strings at a time as there are in a row.
void Concat(State& L, int count) {
    while (count > 1) {
        Value* top = L.m_Top;
        int joined = 2;
        if (!IsText(top[-2]) || !IsText(top[-1])) {
            const Value* method = GetBinaryMethod(L, top[-2], top[-1], Event::Concat);
            if (!method) L.ConcatError(top - 2, top - 1);
            CallMethodInto(L, *method, top[-2], top[-1], top - 2);
        } else {
            L.ToString(top - 1);
            L.ToString(top - 2);
            if (top[-1].AsString()->m_Length != 0 || count > 2) {
                while (joined < count && IsText(top[-joined - 1])) {
                    joined++;
                    L.ToString(top - joined);
                }
                JoinStrings(L, top, joined);
            }
        }
        count -= joined - 1;
        L.m_Top -= joined - 1;
    }
}

}  // namespace Korvel::TextForm

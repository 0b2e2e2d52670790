// Errors and their messages: where, and what the value was called in the text.
#include <cstdio>

#include "textform/Numbers.h"
#include "textform/Opcodes.h"
#include "textform/State.h"
#include "textform/Vm.h"

namespace Korvel::TextForm {

namespace {

bool IsScript(const CallInfo* call) {
    return call->m_Function->IsFunction() && !call->m_Function->AsFunction()->IsNative();
}

const Prototype* GetPrototype(const CallInfo* call) {
    return AsScript(call->m_Function->AsFunction())->m_Prototype;
}

// The instruction that a call is at.
int GetCurrentPc(const CallInfo* call) {
    return static_cast<int>(call->m_Pc - GetPrototype(call)->m_Code) - 1;
}

const char* GetLocalName(const Prototype* p, int reg, int pc) {
    for (int i = 0; i < p->m_LocalCount && p->m_Locals[i].m_StartPc <= pc; i++) {
        if (pc < p->m_Locals[i].m_EndPc && reg-- == 0) return p->m_Locals[i].m_Name->GetText();
    }
    return nullptr;
}

const char* GetConstantName(const Prototype* p, int index) {
    const Value& constant = p->m_Constants[index];
    return constant.IsString() ? constant.AsString()->GetText() : "?";
}

const char* GetOperandName(const Prototype* p, int operand) {
    return IsConstant(operand) ? GetConstantName(p, GetConstantIndex(operand)) : "?";
}

// The last instruction before `end` that sets a register, on a straight way through the code.
int FindSetter(const Prototype* p, int end, int reg) {
    int setter = -1;
    for (int pc = 0; pc < end; pc++) {
        Instruction i = p->m_Code[pc];
        Op op = GetOp(i);
        int a = GetA(i);
        if (SetsA(op) && a == reg) setter = pc;
        switch (op) {
            case Op::LoadNil:
                if (a <= reg && reg <= GetB(i)) setter = pc;
                break;
            case Op::TForLoop:
                if (reg >= a + 2) setter = pc;
                break;
            case Op::TForPrep:
            case Op::ForLoop:
            case Op::ForPrep:
            case Op::Jmp: {
                int target = pc + 1 + GetSignedBx(i);
                if (pc < target && target <= end) pc = target - 1;
                break;
            }
            case Op::Call:
            case Op::TailCall:
                if (reg >= a) setter = pc;
                break;
            case Op::Self:
                if (reg == a + 1) setter = pc;
                break;
            case Op::SetList:
                if (GetC(i) == 0) pc++;
                break;
            case Op::Closure:
                pc += p->m_Prototypes[GetBx(i)]->m_UpValueCount;
                break;
            default:
                break;
        }
    }
    return setter;
}

CallSite NameRegister(const Prototype* p, int pc, int reg) {
    if (const char* name = GetLocalName(p, reg, pc)) return {"local", name};
    int setter = FindSetter(p, pc, reg);
    if (setter < 0) return {};
    Instruction i = p->m_Code[setter];
    switch (GetOp(i)) {
        case Op::GetGlobal: {
            int index = GetBx(i);
            if (setter > 0 && GetOp(p->m_Code[setter - 1]) == Op::PreloadK) {
                index += GetBx(p->m_Code[setter - 1]) << 18;
            }
            return {"global", GetConstantName(p, index)};
        }
        case Op::Move:
            if (GetB(i) < GetA(i)) return NameRegister(p, setter, GetB(i));
            return {};
        case Op::GetTable:
            return {"field", GetOperandName(p, GetC(i))};
        case Op::GetUpVal:
            return {"upvalue",
                    GetB(i) < p->m_UpValueNameCount ? p->m_UpValueNames[GetB(i)]->GetText() : "?"};
        case Op::Self:
            return {"method", GetOperandName(p, GetC(i))};
        default:
            return {};
    }
}

}  // namespace

int State::GetCurrentLine(const CallInfo* call) const {
    if (!IsScript(call)) return -1;
    const Prototype* p = GetPrototype(call);
    int pc = GetCurrentPc(call);
    return pc >= 0 && pc < p->m_LineCount ? p->m_Lines[pc] : 0;
}

CallSite State::GetCallSite(const CallInfo* call) const {
    if (call == m_Calls) return {};
    if ((IsScript(call) && call->m_TailCalls > 0) || !IsScript(call - 1)) return {};
    call--;
    int pc = GetCurrentPc(call);
    Instruction i = GetPrototype(call)->m_Code[pc];
    switch (GetOp(i)) {
        case Op::Call:
        case Op::TailCall:
        case Op::TForLoop:
            return NameRegister(GetPrototype(call), pc, GetA(i));
        default:
            return {};
    }
}

bool State::GetLevel(int level, Level& found) const {
    CallInfo* call = m_Call;
    for (; level > 0 && call > m_Calls; call--) {
        level--;
        if (IsScript(call)) level -= call->m_TailCalls;
    }
    if (level == 0 && call > m_Calls) {
        found = {call};
        return true;
    }
    found = {nullptr};
    return level < 0;
}

void State::PushWhere(int level) {
    Level found;
    if (GetLevel(level, found) && found.m_Call && GetCurrentLine(found.m_Call) > 0) {
        char place[kChunkIdSize];
        GetChunkId(place, sizeof place, GetPrototype(found.m_Call)->m_Source->GetText());
        PushFormat("%s:%d: ", place, GetCurrentLine(found.m_Call));
    } else {
        PushString("");
    }
}

void State::Throw(Status status) {
    throw Raised{status};
}

void Machine::RaiseMemoryError() {
    if (!m_IsLimited) throw Raised{Status::MemoryError};
    m_Exceeded = Status::MemoryError;
    throw Raised{Status::LimitError};
}

void Machine::RaiseLimit() {
    if (m_Exceeded == Status::Ok) m_Exceeded = Status::LimitError;
    throw Raised{Status::LimitError};
}

void State::ThrowValue() {
    if (m_Handler) {
        const Value handler = *GetPlace(m_Handler);
        if (!handler.IsFunction()) Throw(Status::HandlerError);
        m_Top[0] = m_Top[-1];
        m_Top[-1] = handler;
        m_Top++;
        NeedStack(1);
        CallAt(m_Top - 2, 1);
    }
    Throw(Status::RunError);
}

void State::Error(const char* format, ...) {
    va_list args;
    va_start(args, format);
    PushWhere(1);
    PushFormatV(format, args);
    va_end(args);
    Concat(*this, 2);
    ThrowValue();
}

void State::RunError(const char* format, ...) {
    va_list args;
    va_start(args, format);
    const char* message = PushFormatV(format, args);
    va_end(args);
    if (IsScript(m_Call)) {
        char place[kChunkIdSize];
        GetChunkId(place, sizeof place, GetPrototype(m_Call)->m_Source->GetText());
        PushFormat("%s:%d: %s", place, GetCurrentLine(m_Call), message);
    }
    ThrowValue();
}

void State::ArgError(int i, const char* message) {
    CallSite site = GetCallSite(m_Call);
    if (site.m_Kind && strcmp(site.m_Kind, "method") == 0) {
        i--;  // self is not counted
        if (i == 0) Error("calling '%s' on bad self (%s)", site.m_Name, message);
    }
    Error("bad argument #%d to '%s' (%s)", i, site.m_Name ? site.m_Name : "?", message);
}

void State::TypeError(int i, const char* typeName) {
    ArgError(i, PushFormat("%s expected, got %s", typeName, GetTypeName(GetArgType(i))));
}

void State::OperandError(const Value* operand, const char* operation) {
    const char* type = GetTypeName(operand->m_Type);
    CallSite site = {};
    if (IsScript(m_Call) && operand >= m_Call->m_Base && operand < m_Call->m_Top) {
        Charge(GetPrototype(m_Call)->m_CodeCount / 16);
        site = NameRegister(GetPrototype(m_Call), GetCurrentPc(m_Call),
                            static_cast<int>(operand - m_Base));
    }
    if (site.m_Kind) {
        RunError("attempt to %s %s '%s' (a %s value)", operation, site.m_Kind, site.m_Name, type);
    }
    RunError("attempt to %s a %s value", operation, type);
}

void State::ArithmeticError(const Value* a, const Value* b) {
    double number;
    OperandError(ToNumber(*a, number) ? b : a, "perform arithmetic on");
}

void State::ConcatError(const Value* a, const Value* b) {
    OperandError(a->IsString() || a->IsNumber() ? b : a, "concatenate");
}

void State::CompareError(const Value* a, const Value* b) {
    const char* first = GetTypeName(a->m_Type);
    const char* second = GetTypeName(b->m_Type);
    if (first[2] == second[2]) RunError("attempt to compare two %s values", first);
    RunError("attempt to compare %s with %s", first, second);
}

}  // namespace Korvel::TextForm

// Instructions, jumps, constants and scopes. Expressions: Code_Expressions.cpp.
#include "textform/Code.h"

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <utility>

#include "textform/Lexer.h"

namespace Korvel::TextForm {

FunctionCode::FunctionCode(Lexer& lexer, FunctionCode* outer)
    : m_Outer(outer), m_Lexer(lexer), m_State(lexer.GetState()) {
    Machine& machine = m_State.GetMachine();
    m_Prototype = NewPrototype(machine);
    m_Prototype->m_Source = lexer.GetChunkName();
    m_Prototype->m_MaxStackSize = 2;          // registers 0 and 1 are always valid
    uint8_t hashState = m_State.m_HashState;  // the one-shot is for tables that programs see
    m_ConstantIndex = NewTable(m_State, 0, 0);
    m_ConstantIndex->m_Flags = Table::kHashed;
    m_State.m_HashState = hashState;
}

// The arrays have room to grow, which the prototype does not know of.
FunctionCode::~FunctionCode() {
    if (m_IsFinished) return;
    Machine& machine = m_State.GetMachine();
    Prototype* p = m_Prototype;
    machine.FreeArray(std::exchange(p->m_Code, nullptr), m_CodeCapacity);
    machine.FreeArray(std::exchange(p->m_Lines, nullptr), m_LineCapacity);
    machine.FreeArray(std::exchange(p->m_Constants, nullptr), m_ConstantCapacity);
    machine.FreeArray(std::exchange(p->m_Prototypes, nullptr), m_PrototypeCapacity);
    machine.FreeArray(std::exchange(p->m_Locals, nullptr), m_LocalCapacity);
    machine.FreeArray(std::exchange(p->m_UpValueNames, nullptr), m_UpValueCapacity);
    p->m_ConstantCount = p->m_PrototypeCount = p->m_LocalCount = p->m_UpValueNameCount = 0;
}

int FunctionCode::Emit(Instruction instruction) {
    PatchWaiting();
    Machine& machine = m_State.GetMachine();
    machine.Grow(m_Prototype->m_Code, m_CodeCapacity, m_Pc + 1);
    machine.Grow(m_Prototype->m_Lines, m_LineCapacity, m_Pc + 1);
    m_Prototype->m_Code[m_Pc] = instruction;
    m_Prototype->m_Lines[m_Pc] = m_Lexer.GetLastLine();
    return m_Pc++;
}

void FunctionCode::SetLine(int line) {
    m_Prototype->m_Lines[m_Pc - 1] = line;
}

int FunctionCode::EmitWithConstant(Op op, int a, int constant) {
    if (constant > kMaxBx) EmitABx(Op::PreloadK, op == Op::LoadK ? a : 0, constant >> 18);
    return EmitABx(op, a, constant & kMaxBx);
}

void FunctionCode::EmitNil(int from, int count) {
    if (m_Pc > m_LastTarget) {
        if (m_Pc == 0) {
            if (from >= m_ActiveCount) return;  // registers begin as nil
        } else {
            Instruction& previous = At(m_Pc - 1);
            if (GetOp(previous) == Op::LoadNil) {
                int first = GetA(previous);
                int last = GetB(previous);
                if (first <= from && from <= last + 1) {
                    if (from + count - 1 > last) SetB(previous, from + count - 1);
                    return;
                }
            }
        }
    }
    EmitABC(Op::LoadNil, from, from + count - 1, 0);
}

void FunctionCode::EmitSetList(int base, int itemCount, int toStore) {
    int flush = (itemCount - 1) / kFieldsPerFlush + 1;
    int count = toStore == kAllResults ? 0 : toStore;
    if (flush <= kMaxC) {
        EmitABC(Op::SetList, base, count, flush);
    } else {
        EmitABC(Op::SetList, base, count, 0);
        m_ListNumbers.push_back(Emit(static_cast<Instruction>(flush)));
    }
    m_FreeRegister = base + 1;
}

// ---- Jumps

int FunctionCode::EmitJump() {
    int waiting = m_Waiting;
    m_Waiting = kNoJump;
    int jump = EmitAsBx(Op::Jmp, 0, kNoJump);
    Join(jump, waiting);
    return jump;
}

int FunctionCode::MarkTarget() {
    m_LastTarget = m_Pc;
    return m_Pc;
}

int FunctionCode::GetJump(int pc) const {
    int offset = GetSignedBx(m_Prototype->m_Code[pc]);
    return offset == kNoJump ? kNoJump : pc + 1 + offset;
}

void FunctionCode::FixJump(int pc, int target) {
    int offset = target - (pc + 1);
    if (std::abs(offset) > kMaxSignedBx) m_Lexer.Fail("control structure too long");
    SetSignedBx(At(pc), offset);
}

void FunctionCode::Join(int& list, int other) {
    if (other == kNoJump) return;
    if (list == kNoJump) {
        list = other;
        return;
    }
    int last = list;
    size_t steps = 0;
    for (int next; (next = GetJump(last)) != kNoJump; steps++) last = next;
    m_State.Charge(steps / 16);
    FixJump(last, other);
}

// The test that decides whether a jump is taken, else the jump itself.
Instruction& FunctionCode::GetControl(int pc) {
    if (pc < 1 || !IsTest(GetOp(At(pc - 1)))) return At(pc);
    bool isNumber = std::binary_search(m_ListNumbers.begin(), m_ListNumbers.end(), pc - 1);
    return At(isNumber ? pc : pc - 1);
}

// Whether a jump of the list leaves no value in a register.
bool FunctionCode::NeedsValue(int list) {
    for (; list != kNoJump; list = GetJump(list)) {
        if (GetOp(GetControl(list)) != Op::TestSet) return true;
    }
    return false;
}

// Lets the test before a jump store into `reg`, or only test when there is nothing to store.
bool FunctionCode::PatchTest(int node, int reg) {
    Instruction& control = GetControl(node);
    if (GetOp(control) != Op::TestSet) return false;
    if (reg != kMaxA && reg != GetB(control)) {
        SetA(control, reg);
    } else {
        control = MakeABC(Op::Test, GetB(control), 0, GetC(control));
    }
    return true;
}

void FunctionCode::DropValues(int list) {
    for (; list != kNoJump; list = GetJump(list)) PatchTest(list, kMaxA);
}

void FunctionCode::PatchList(int list, int valueTarget, int reg, int defaultTarget) {
    while (list != kNoJump) {
        int next = GetJump(list);
        FixJump(list, PatchTest(list, reg) ? valueTarget : defaultTarget);
        list = next;
    }
}

void FunctionCode::PatchWaiting() {
    int list = m_Waiting;
    m_Waiting = kNoJump;
    PatchList(list, m_Pc, kMaxA, m_Pc);
}

void FunctionCode::PatchTo(int list, int target) {
    if (target == m_Pc) {
        PatchHere(list);
    } else {
        PatchList(list, target, kMaxA, target);
    }
}

void FunctionCode::PatchHere(int list) {
    MarkTarget();
    Join(m_Waiting, list);
}

// ---- Constants

int FunctionCode::AddConstant(const Value& key, const Value& value) {
    Value* slot = SetSlot(m_State, m_ConstantIndex, key);
    if (slot->IsNumber()) return static_cast<int>(slot->m_Number);
    Prototype* p = m_Prototype;
    int index = p->m_ConstantCount;
    if (index >= kMaxConstants) m_State.RunError("constant table overflow");
    *slot = Value::Number(index);
    m_State.GetMachine().Grow(p->m_Constants, m_ConstantCapacity, index + 1);
    p->m_Constants[index] = value;
    p->m_ConstantCount = index + 1;
    return index;
}

int FunctionCode::AddString(String* text) {
    return AddConstant(Value::Of(text), Value::Of(text));
}

int FunctionCode::AddNumber(double number) {
    return AddConstant(Value::Number(number), Value::Number(number));
}

// ---- Registers

void FunctionCode::CheckStack(int count) {
    int size = m_FreeRegister + count;
    if (size <= m_Prototype->m_MaxStackSize) return;
    if (size >= kMaxStack) m_Lexer.Fail("function or expression too complex");
    m_Prototype->m_MaxStackSize = static_cast<uint8_t>(size);
}

void FunctionCode::Reserve(int count) {
    CheckStack(count);
    m_FreeRegister += count;
}

void FunctionCode::FreeRegister(int reg) {
    if (!IsConstant(reg) && reg >= m_ActiveCount) m_FreeRegister--;
}

// ---- Locals and scopes

void FunctionCode::CheckLimit(int value, int limit, const char* what) {
    if (value <= limit) return;
    int line = m_Prototype->m_LineDefined;
    m_Lexer.FailNear(
        line == 0
            ? m_State.PushFormat("main function has more than %d %s", limit, what)
            : m_State.PushFormat("function at line %d has more than %d %s", line, limit, what),
        0);
}

void FunctionCode::DeclareLocal(String* name, int index) {
    CheckLimit(m_ActiveCount + index + 1, kMaxLocals, "local variables");
    Prototype* p = m_Prototype;
    int place = p->m_LocalCount;
    if (place > SHRT_MAX) m_State.RunError("too many local variables");
    m_State.GetMachine().Grow(p->m_Locals, m_LocalCapacity, place + 1);
    p->m_Locals[place] = {name, 0, 0};
    p->m_LocalCount = place + 1;
    m_Active[m_ActiveCount + index] = static_cast<uint16_t>(place);
}

void FunctionCode::ActivateLocals(int count) {
    m_ActiveCount += count;
    for (; count > 0; count--) GetLocal(m_ActiveCount - count).m_StartPc = m_Pc;
}

void FunctionCode::EndLocals(int keep) {
    while (m_ActiveCount > keep) GetLocal(--m_ActiveCount).m_EndPc = m_Pc;
}

int FunctionCode::FindLocal(String* name) const {
    for (int i = m_ActiveCount - 1; i >= 0; i--) {
        if (m_Prototype->m_Locals[m_Active[i]].m_Name == name) return i;
    }
    return -1;
}

int FunctionCode::FindUpValue(String* name, const Expression& where) {
    Prototype* p = m_Prototype;
    int count = p->m_UpValueCount;
    for (int i = 0; i < count; i++) {
        if (m_UpValues[i].m_Kind == where.m_Kind && m_UpValues[i].m_Info == where.m_Info) return i;
    }
    CheckLimit(count + 1, kMaxUpValues, "upvalues");
    m_State.GetMachine().Grow(p->m_UpValueNames, m_UpValueCapacity, count + 1);
    p->m_UpValueNames[count] = name;
    p->m_UpValueNameCount = count + 1;
    m_UpValues[count] = {where.m_Kind, where.m_Info};
    p->m_UpValueCount++;
    return count;
}

void FunctionCode::MarkUpValue(int level) {
    Block* block = m_Block;
    while (block && block->m_ActiveCount > level) block = block->m_Outer;
    if (block) block->m_HasUpValues = true;
}

void FunctionCode::EnterBlock(Block& block, bool isLoop) {
    block = {m_Block, kNoJump, m_ActiveCount, false, isLoop};
    m_Block = &block;
}

void FunctionCode::LeaveBlock() {
    Block* block = m_Block;
    m_Block = block->m_Outer;
    EndLocals(block->m_ActiveCount);
    if (block->m_HasUpValues) EmitABC(Op::Close, block->m_ActiveCount, 0, 0);
    m_FreeRegister = m_ActiveCount;
    PatchHere(block->m_BreakJumps);
}

int FunctionCode::AddPrototype(Prototype* prototype) {
    Prototype* p = m_Prototype;
    int index = p->m_PrototypeCount;
    if (index > kMaxBx) m_State.RunError("constant table overflow");
    m_State.GetMachine().Grow(p->m_Prototypes, m_PrototypeCapacity, index + 1);
    p->m_Prototypes[index] = prototype;
    p->m_PrototypeCount = index + 1;
    return index;
}

void FunctionCode::Finish() {
    EndLocals(0);
    EmitReturn(0, 0);
    Machine& machine = m_State.GetMachine();
    Prototype* p = m_Prototype;
    p->m_Code = machine.ResizeArray(p->m_Code, m_CodeCapacity, m_Pc);
    p->m_CodeCount = m_Pc;
    p->m_Lines = machine.ResizeArray(p->m_Lines, m_LineCapacity, m_Pc);
    p->m_LineCount = m_Pc;
    p->m_Constants = machine.ResizeArray(p->m_Constants, m_ConstantCapacity, p->m_ConstantCount);
    p->m_Prototypes =
        machine.ResizeArray(p->m_Prototypes, m_PrototypeCapacity, p->m_PrototypeCount);
    p->m_Locals = machine.ResizeArray(p->m_Locals, m_LocalCapacity, p->m_LocalCount);
    p->m_UpValueNames =
        machine.ResizeArray(p->m_UpValueNames, m_UpValueCapacity, p->m_UpValueNameCount);
    m_IsFinished = true;
}

}  // namespace Korvel::TextForm

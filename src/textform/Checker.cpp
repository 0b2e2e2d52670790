// Checks the code of a chunk that comes from outside.
//
// The machine's loop trusts its instructions, so all that it would not notice is refused: operands
// beyond the stack, the constants or the up-values, jumps out of the code or between the words of
// an instruction, tests without a jump behind. The types of values are looked at when it runs.
#include <vector>

#include "textform/Chunk.h"
#include "textform/Code.h"

namespace Korvel::TextForm {

namespace {

class Checker {
public:
    explicit Checker(const Prototype* p) : m_P(p), m_IsInner(p->m_CodeCount) {}

    bool Check() {
        if (!CheckFrame() || !FindInnerWords()) return false;
        for (int pc = 0; pc < m_P->m_CodeCount; pc++) {
            if (!m_IsInner[pc] && !CheckInstruction(pc)) return false;
        }
        return true;
    }

private:
    bool CheckFrame() const;
    bool FindInnerWords();
    bool CheckInstruction(int pc) const;
    bool CheckRegisters(int pc) const;
    bool CheckOpenResults(int pc) const;
    bool CheckClosure(int pc) const;

    bool IsRegister(int reg) const { return reg < m_P->m_MaxStackSize; }
    bool IsTarget(int pc) const { return pc >= 0 && pc < m_P->m_CodeCount && !m_IsInner[pc]; }
    bool IsOperand(int value, Operand kind) const {
        switch (kind) {
            case Operand::Unused:
                return value == 0;
            case Operand::Used:
                return true;
            case Operand::Register:
                return IsRegister(value);
            default:
                return IsConstant(value) ? GetConstantIndex(value) < m_P->m_ConstantCount
                                         : IsRegister(value);
        }
    }
    bool IsConstantFor(Op op, int index) const {
        if (index >= m_P->m_ConstantCount) return false;
        return op == Op::LoadK || m_P->m_Constants[index].IsString();
    }

    const Prototype* m_P;
    std::vector<bool> m_IsInner;  // words that belong to the instruction before
};

bool Checker::CheckFrame() const {
    const Prototype& p = *m_P;
    bool hasArg = (p.m_VarargFlags & Prototype::kHasArg) != 0;
    bool needsArg = (p.m_VarargFlags & Prototype::kNeedsArg) != 0;
    return p.m_MaxStackSize <= FunctionCode::kMaxStack &&
           p.m_ParameterCount + hasArg <= p.m_MaxStackSize && (!needsArg || hasArg) &&
           p.m_UpValueNameCount <= p.m_UpValueCount &&
           (p.m_LineCount == p.m_CodeCount || p.m_LineCount == 0) && p.m_CodeCount > 0 &&
           GetOp(p.m_Code[p.m_CodeCount - 1]) == Op::Return;
}

bool Checker::FindInnerWords() {
    int count = m_P->m_CodeCount;
    for (int pc = 0; pc < count; pc++) {
        Instruction i = m_P->m_Code[pc];
        int words = 0;
        switch (GetOp(i)) {
            case Op::SetList:
                words = GetC(i) == 0;
                break;
            case Op::Closure:
                if (GetBx(i) >= m_P->m_PrototypeCount) return false;
                words = m_P->m_Prototypes[GetBx(i)]->m_UpValueCount;
                break;
            case Op::PreloadK:
                words = 1;
                break;
            default:
                break;
        }
        if (words >= count - pc) return false;
        for (; words > 0; words--) m_IsInner[++pc] = true;
    }
    return !m_IsInner[count - 1];
}

// What takes all results up to the top must stand right behind what leaves them, and begin below:
// there may be none.
bool Checker::CheckOpenResults(int pc) const {
    int first = GetA(m_P->m_Code[pc]);
    Instruction next = m_P->m_Code[pc + 1];
    switch (GetOp(next)) {
        case Op::Call:
        case Op::TailCall:
        case Op::SetList:
            return GetB(next) == 0 && GetA(next) < first;
        case Op::Return:
            return GetB(next) == 0 && GetA(next) <= first;
        default:
            return false;
    }
}

bool Checker::CheckClosure(int pc) const {
    int count = m_P->m_Prototypes[GetBx(m_P->m_Code[pc])]->m_UpValueCount;
    for (; count > 0; count--) {
        Instruction source = m_P->m_Code[++pc];
        bool isGood = GetOp(source) == Op::GetUpVal
                          ? GetB(source) < m_P->m_UpValueCount
                          : GetOp(source) == Op::Move && IsRegister(GetB(source));
        if (!isGood) return false;
    }
    return true;
}

// The rows of registers that some operations use.
bool Checker::CheckRegisters(int pc) const {
    Instruction i = m_P->m_Code[pc];
    int a = GetA(i);
    int b = GetB(i);
    int c = GetC(i);
    switch (GetOp(i)) {
        case Op::LoadNil:
            return a <= b;
        case Op::LoadBool:
            return c == 0 || IsTarget(pc + 2);
        case Op::GetUpVal:
        case Op::SetUpVal:
            return b < m_P->m_UpValueCount;
        case Op::Self:
        case Op::TForPrep:
            return IsRegister(a + 1);
        case Op::Concat:
            return b < c;
        case Op::ForLoop:
        case Op::ForPrep:
            return IsRegister(a + 3);
        case Op::TForLoop:
            return c >= 1 && IsRegister(a + 2 + c) && IsRegister(a + 5);
        case Op::Call:
            if (b != 0 && !IsRegister(a + b - 1)) return false;
            return c == 0 ? CheckOpenResults(pc) : c == 1 || IsRegister(a + c - 2);
        case Op::TailCall:  // a native function's results are returned by what follows
            if (b != 0 && !IsRegister(a + b - 1)) return false;
            return c == 0 && GetOp(m_P->m_Code[pc + 1]) == Op::Return && CheckOpenResults(pc);
        case Op::Return:
            return b < 2 || IsRegister(a + b - 2);
        case Op::SetList:
            return b == 0 || IsRegister(a + b);
        case Op::Vararg:
            if (!(m_P->m_VarargFlags & Prototype::kIsVararg) ||
                (m_P->m_VarargFlags & Prototype::kNeedsArg)) {
                return false;
            }
            return b == 0 ? CheckOpenResults(pc) : b == 1 || IsRegister(a + b - 2);
        default:
            return true;
    }
}

bool Checker::CheckInstruction(int pc) const {
    Instruction i = m_P->m_Code[pc];
    Op op = GetOp(i);
    if (static_cast<int>(op) >= kOpCount || !IsRegister(GetA(i))) return false;
    bool isLast = pc + 1 == m_P->m_CodeCount;
    if (isLast) return op == Op::Return && CheckRegisters(pc);
    switch (GetFormat(op)) {
        case Format::ABC:
            if (!IsOperand(GetB(i), GetOperandB(op)) || !IsOperand(GetC(i), GetOperandC(op))) {
                return false;
            }
            break;
        case Format::AsBx:
            if (!IsTarget(pc + 1 + GetSignedBx(i))) return false;
            break;
        default:
            break;
    }
    if (IsTest(op)) {
        Instruction next = m_P->m_Code[pc + 1];
        if (GetOp(next) != Op::Jmp || !IsTarget(pc + 1)) return false;
    }
    switch (op) {
        case Op::LoadK:
        case Op::GetGlobal:
        case Op::SetGlobal:
            return IsConstantFor(op, GetBx(i));
        case Op::PreloadK: {
            Instruction next = m_P->m_Code[pc + 1];
            Op nextOp = GetOp(next);
            if (nextOp != Op::LoadK && nextOp != Op::GetGlobal && nextOp != Op::SetGlobal) {
                return false;
            }
            int64_t index = static_cast<int64_t>(GetBx(i)) << 18 | GetBx(next);
            return index < m_P->m_ConstantCount && IsRegister(GetA(next)) &&
                   IsConstantFor(nextOp, static_cast<int>(index));
        }
        case Op::Closure:
            return CheckClosure(pc);
        default:
            return CheckRegisters(pc);
    }
}

}  // namespace

bool CheckCode(const Prototype* prototype) {
    return Checker(prototype).Check();
}

}  // namespace Korvel::TextForm

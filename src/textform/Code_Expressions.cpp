// From descriptions of expressions to instructions.
#include <cmath>
#include <utility>

#include "textform/Code.h"
#include "textform/Lexer.h"
#include "textform/Vm.h"

namespace Korvel::TextForm {

void FunctionCode::SetResultCount(Expression& e, int count) {
    if (e.m_Kind == Expression::Call) {
        SetC(At(e), count + 1);
    } else if (e.m_Kind == Expression::Vararg) {
        SetB(At(e), count + 1);
        SetA(At(e), m_FreeRegister);
        Reserve(1);
    }
}

void FunctionCode::SetOneResult(Expression& e) {
    if (e.m_Kind == Expression::Call) {
        e.m_Kind = Expression::Register;
        e.m_Info = GetA(At(e));
    } else if (e.m_Kind == Expression::Vararg) {
        SetB(At(e), 2);
        e.m_Kind = Expression::Relocatable;
    }
}

void FunctionCode::Free(const Expression& e) {
    if (e.m_Kind == Expression::Register) FreeRegister(e.m_Info);
}

void FunctionCode::Discharge(Expression& e) {
    switch (e.m_Kind) {
        case Expression::Local:
            e.m_Kind = Expression::Register;
            break;
        case Expression::UpValue:
            e.m_Info = EmitABC(Op::GetUpVal, 0, e.m_Info, 0);
            e.m_Kind = Expression::Relocatable;
            break;
        case Expression::Global:
            e.m_Info = EmitWithConstant(Op::GetGlobal, 0, e.m_Info);
            e.m_Kind = Expression::Relocatable;
            break;
        case Expression::Indexed:
            FreeRegister(e.m_Aux);
            FreeRegister(e.m_Info);
            e.m_Info = EmitABC(Op::GetTable, 0, e.m_Info, e.m_Aux);
            e.m_Kind = Expression::Relocatable;
            break;
        case Expression::Call:
        case Expression::Vararg:
            SetOneResult(e);
            break;
        default:
            break;
    }
}

void FunctionCode::DischargeToRegister(Expression& e, int reg) {
    Discharge(e);
    switch (e.m_Kind) {
        case Expression::Nil:
            EmitNil(reg, 1);
            break;
        case Expression::False:
        case Expression::True:
            EmitABC(Op::LoadBool, reg, e.m_Kind == Expression::True, 0);
            break;
        case Expression::Constant:
            EmitWithConstant(Op::LoadK, reg, e.m_Info);
            break;
        case Expression::Number:
            EmitWithConstant(Op::LoadK, reg, AddNumber(e.m_Number));
            break;
        case Expression::Relocatable:
            SetA(At(e), reg);
            break;
        case Expression::Register:
            if (reg != e.m_Info) EmitABC(Op::Move, reg, e.m_Info, 0);
            break;
        default:
            return;  // nothing to load
    }
    e.m_Info = reg;
    e.m_Kind = Expression::Register;
}

void FunctionCode::DischargeToAnyRegister(Expression& e) {
    if (e.m_Kind == Expression::Register) return;
    Reserve(1);
    DischargeToRegister(e, m_FreeRegister - 1);
}

int FunctionCode::EmitLabel(int a, int b, int skip) {
    MarkTarget();
    return EmitABC(Op::LoadBool, a, b, skip);
}

void FunctionCode::ToRegister(Expression& e, int reg) {
    DischargeToRegister(e, reg);
    if (e.m_Kind == Expression::Jump) Join(e.m_TrueJumps, e.m_Info);
    if (e.HasJumps()) {
        int loadFalse = kNoJump;
        int loadTrue = kNoJump;
        if (NeedsValue(e.m_TrueJumps) || NeedsValue(e.m_FalseJumps)) {
            int over = e.m_Kind == Expression::Jump ? kNoJump : EmitJump();
            loadFalse = EmitLabel(reg, 0, 1);
            loadTrue = EmitLabel(reg, 1, 0);
            PatchHere(over);
        }
        int end = MarkTarget();
        PatchList(e.m_FalseJumps, end, reg, loadFalse);
        PatchList(e.m_TrueJumps, end, reg, loadTrue);
    }
    e.m_FalseJumps = e.m_TrueJumps = kNoJump;
    e.m_Info = reg;
    e.m_Kind = Expression::Register;
}

void FunctionCode::ToNextRegister(Expression& e) {
    Discharge(e);
    Free(e);
    Reserve(1);
    ToRegister(e, m_FreeRegister - 1);
}

int FunctionCode::ToAnyRegister(Expression& e) {
    Discharge(e);
    if (e.m_Kind == Expression::Register) {
        if (!e.HasJumps()) return e.m_Info;
        if (e.m_Info >= m_ActiveCount) {
            ToRegister(e, e.m_Info);
            return e.m_Info;
        }
    }
    ToNextRegister(e);
    return e.m_Info;
}

void FunctionCode::ToValue(Expression& e) {
    if (e.HasJumps()) {
        ToAnyRegister(e);
    } else {
        Discharge(e);
    }
}

int FunctionCode::ToOperand(Expression& e) {
    ToValue(e);
    switch (e.m_Kind) {
        case Expression::Number:
        case Expression::True:
        case Expression::False:
        case Expression::Nil:
            if (m_Prototype->m_ConstantCount > kMaxRkIndex) break;
            if (e.m_Kind == Expression::Number) {
                e.m_Info = AddNumber(e.m_Number);
            } else if (e.m_Kind == Expression::Nil) {
                // nil is no key, so the index stands in for it
                e.m_Info = AddConstant(Value::Of(m_ConstantIndex), Value::Nil());
            } else {
                Value value = Value::Boolean(e.m_Kind == Expression::True);
                e.m_Info = AddConstant(value, value);
            }
            e.m_Kind = Expression::Constant;
            return e.m_Info | kConstantBit;
        case Expression::Constant:
            if (e.m_Info <= kMaxRkIndex) return e.m_Info | kConstantBit;
            break;
        default:
            break;
    }
    return ToAnyRegister(e);
}

void FunctionCode::Store(const Expression& variable, Expression& value) {
    switch (variable.m_Kind) {
        case Expression::Local:
            Free(value);
            ToRegister(value, variable.m_Info);
            return;
        case Expression::UpValue:
            EmitABC(Op::SetUpVal, ToAnyRegister(value), variable.m_Info, 0);
            break;
        case Expression::Global:
            EmitWithConstant(Op::SetGlobal, ToAnyRegister(value), variable.m_Info);
            break;
        default:
            EmitABC(Op::SetTable, variable.m_Info, variable.m_Aux, ToOperand(value));
    }
    Free(value);
}

void FunctionCode::EmitSelf(Expression& object, Expression& key) {
    ToAnyRegister(object);
    Free(object);
    int function = m_FreeRegister;
    Reserve(2);
    EmitABC(Op::Self, function, object.m_Info, ToOperand(key));
    Free(key);
    object.m_Info = function;
    object.m_Kind = Expression::Register;
}

void FunctionCode::MakeIndexed(Expression& table, Expression& key) {
    table.m_Aux = ToOperand(key);
    table.m_Kind = Expression::Indexed;
}

// ---- Conditions

void FunctionCode::InvertJump(const Expression& e) {
    Instruction& control = GetControl(e.m_Info);
    SetA(control, !GetA(control));
}

int FunctionCode::EmitCondition(Op op, int a, int b, int c) {
    EmitABC(op, a, b, c);
    return EmitJump();
}

int FunctionCode::JumpOn(Expression& e, bool condition) {
    if (e.m_Kind == Expression::Relocatable && GetOp(At(e)) == Op::Not) {
        int operand = GetB(At(e));
        m_Pc--;  // the test makes up for it
        return EmitCondition(Op::Test, operand, 0, !condition);
    }
    DischargeToAnyRegister(e);
    Free(e);
    return EmitCondition(Op::TestSet, kMaxA, e.m_Info, condition);
}

// A constant that always jumps is tested like any value: a jump without a test would take along
// those that wait for this place, and their tests would store into the expression's register.
void FunctionCode::JumpIfFalse(Expression& e) {
    Discharge(e);
    int jump;
    switch (e.m_Kind) {
        case Expression::Constant:
        case Expression::Number:
        case Expression::True:
            jump = kNoJump;
            break;
        case Expression::Jump:
            InvertJump(e);
            jump = e.m_Info;
            break;
        default:
            jump = JumpOn(e, false);
    }
    Join(e.m_FalseJumps, jump);
    PatchHere(e.m_TrueJumps);
    e.m_TrueJumps = kNoJump;
}

void FunctionCode::JumpIfTrue(Expression& e) {
    Discharge(e);
    int jump;
    switch (e.m_Kind) {
        case Expression::Nil:
        case Expression::False:
            jump = kNoJump;
            break;
        case Expression::Jump:
            jump = e.m_Info;
            break;
        default:
            jump = JumpOn(e, true);
    }
    Join(e.m_TrueJumps, jump);
    PatchHere(e.m_FalseJumps);
    e.m_FalseJumps = kNoJump;
}

void FunctionCode::EmitNot(Expression& e) {
    Discharge(e);
    switch (e.m_Kind) {
        case Expression::Nil:
        case Expression::False:
            e.m_Kind = Expression::True;
            break;
        case Expression::Constant:
        case Expression::Number:
        case Expression::True:
            e.m_Kind = Expression::False;
            break;
        case Expression::Jump:
            InvertJump(e);
            break;
        default:
            DischargeToAnyRegister(e);
            Free(e);
            e.m_Info = EmitABC(Op::Not, 0, e.m_Info, 0);
            e.m_Kind = Expression::Relocatable;
    }
    std::swap(e.m_TrueJumps, e.m_FalseJumps);
    DropValues(e.m_TrueJumps);
    DropValues(e.m_FalseJumps);
}

// ---- Operators

// Computes an operation on numerals now, unless the result would be none to write as a constant.
static bool Fold(Op op, Expression& a, const Expression& b) {
    if (!a.IsNumeral() || !b.IsNumeral()) return false;
    if (op == Op::Len) return false;
    if ((op == Op::Div || op == Op::Mod) && b.m_Number == 0) return false;
    double result = Calculate(op, a.m_Number, b.m_Number);
    if (std::isnan(result)) return false;
    a.m_Number = result;
    return true;
}

void FunctionCode::EmitArithmetic(Op op, Expression& a, Expression& b) {
    if (Fold(op, a, b)) return;
    int right = op != Op::Unm && op != Op::Len ? ToOperand(b) : 0;
    int left = ToOperand(a);
    // the upper register first
    if (left > right) {
        Free(a);
        Free(b);
    } else {
        Free(b);
        Free(a);
    }
    a.m_Info = EmitABC(op, 0, left, right);
    a.m_Kind = Expression::Relocatable;
}

void FunctionCode::EmitComparison(Op op, bool condition, Expression& a, Expression& b) {
    int left = ToOperand(a);
    int right = ToOperand(b);
    Free(b);
    Free(a);
    if (!condition && op != Op::Eq) {  // "a > b" is "b < a"
        std::swap(left, right);
        condition = true;
    }
    a.m_Info = EmitCondition(op, condition, left, right);
    a.m_Kind = Expression::Jump;
}

void FunctionCode::EmitUnary(UnaryOp op, Expression& e) {
    Expression none(Expression::Number, 0);
    switch (op) {
        case UnaryOp::Minus:
            if (!e.IsNumeral()) ToAnyRegister(e);
            EmitArithmetic(Op::Unm, e, none);
            break;
        case UnaryOp::Not:
            EmitNot(e);
            break;
        default:
            ToAnyRegister(e);
            EmitArithmetic(Op::Len, e, none);
    }
}

void FunctionCode::PrepareBinary(BinaryOp op, Expression& left) {
    switch (op) {
        case BinaryOp::And:
            JumpIfFalse(left);
            break;
        case BinaryOp::Or:
            JumpIfTrue(left);
            break;
        case BinaryOp::Concat:
            ToNextRegister(left);  // operands stand in a row
            break;
        case BinaryOp::Add:
        case BinaryOp::Sub:
        case BinaryOp::Mul:
        case BinaryOp::Div:
        case BinaryOp::Mod:
        case BinaryOp::Pow:
            if (!left.IsNumeral()) ToOperand(left);
            break;
        default:
            ToOperand(left);
    }
}

void FunctionCode::EmitBinary(BinaryOp op, Expression& left, Expression& right) {
    switch (op) {
        case BinaryOp::And:
            Discharge(right);
            Join(right.m_FalseJumps, left.m_FalseJumps);
            left = right;
            break;
        case BinaryOp::Or:
            Discharge(right);
            Join(right.m_TrueJumps, left.m_TrueJumps);
            left = right;
            break;
        case BinaryOp::Concat:
            ToValue(right);
            if (right.m_Kind == Expression::Relocatable && GetOp(At(right)) == Op::Concat) {
                Free(left);
                SetB(At(right), left.m_Info);
                left.m_Kind = Expression::Relocatable;
                left.m_Info = right.m_Info;
            } else {
                ToNextRegister(right);
                EmitArithmetic(Op::Concat, left, right);
            }
            break;
        case BinaryOp::NotEqual:
            EmitComparison(Op::Eq, false, left, right);
            break;
        case BinaryOp::Equal:
            EmitComparison(Op::Eq, true, left, right);
            break;
        case BinaryOp::Less:
            EmitComparison(Op::Lt, true, left, right);
            break;
        case BinaryOp::LessEqual:
            EmitComparison(Op::Le, true, left, right);
            break;
        case BinaryOp::Greater:
            EmitComparison(Op::Lt, false, left, right);
            break;
        case BinaryOp::GreaterEqual:
            EmitComparison(Op::Le, false, left, right);
            break;
        default:
            EmitArithmetic(static_cast<Op>(static_cast<int>(Op::Add) + static_cast<int>(op)), left,
                           right);
    }
}

}  // namespace Korvel::TextForm

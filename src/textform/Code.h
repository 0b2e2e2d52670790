// Generates the code of one function while its text is parsed.
//
// An expression is described until it is known where its value is wanted; only then is it
// discharged: to a register, a constant operand, or jumps. Jumps that wait for their target form a
// list through their own offset fields, ended by kNoJump.
#pragma once

#include <vector>

#include "textform/Opcodes.h"
#include "textform/State.h"

namespace Korvel::TextForm {

class Lexer;

struct Expression {
    enum Kind : uint8_t {
        Void,  // an empty list
        Nil,
        True,
        False,
        Constant,     // m_Info: index of the constant
        Number,       // m_Number
        Local,        // m_Info: register
        UpValue,      // m_Info: index of the up-value
        Global,       // m_Info: index of the name
        Indexed,      // m_Info: register of the table; m_Aux: register or constant of the key
        Jump,         // m_Info: the jump that is taken when it is true
        Relocatable,  // m_Info: the instruction whose A is open
        Register,     // m_Info: register
        Call,         // m_Info: the instruction
        Vararg,       // m_Info: the instruction
    };

    Expression() = default;
    Expression(Kind kind, int info) : m_Kind(kind), m_Info(info) {}

    bool HasJumps() const { return m_TrueJumps != m_FalseJumps; }
    bool IsMulti() const { return m_Kind == Call || m_Kind == Vararg; }
    bool IsNumeral() const {
        return m_Kind == Number && m_TrueJumps == kNoJump && m_FalseJumps == kNoJump;
    }

    Kind m_Kind = Void;
    int m_Info = 0;
    int m_Aux = 0;
    double m_Number = 0;
    int m_TrueJumps = kNoJump;   // left when the expression is true
    int m_FalseJumps = kNoJump;  // left when it is false
};

enum class BinaryOp : uint8_t {
    Add,
    Sub,
    Mul,
    Div,
    Mod,
    Pow,
    Concat,
    NotEqual,
    Equal,
    Less,
    LessEqual,
    Greater,
    GreaterEqual,
    And,
    Or,
    None,
};
enum class UnaryOp : uint8_t { Minus, Not, Length, None };

// A scope of local variables. Lives on the parser's own stack.
struct Block {
    Block* m_Outer;
    int m_BreakJumps;
    int m_ActiveCount;   // locals alive outside
    bool m_HasUpValues;  // a closure took one of its locals
    bool m_IsLoop;
};

class FunctionCode {
public:
    static constexpr int kMaxLocals = 200;
    static constexpr int kMaxUpValues = 60;
    static constexpr int kMaxStack = 250;
    static constexpr int kMaxConstants = 0x7FFFFFFD;

    FunctionCode(Lexer& lexer, FunctionCode* outer);
    FunctionCode(const FunctionCode&) = delete;
    FunctionCode& operator=(const FunctionCode&) = delete;
    ~FunctionCode();  // an unfinished prototype is emptied

    // ---- Instructions; each returns its place
    int EmitABC(Op op, int a, int b, int c) { return Emit(MakeABC(op, a, b, c)); }
    int EmitABx(Op op, int a, int bx) { return Emit(MakeABx(op, a, bx)); }
    int EmitAsBx(Op op, int a, int sbx) { return EmitABx(op, a, sbx + kMaxSignedBx); }
    int Emit(Instruction instruction);
    // With a constant of any index, after a PreloadK if it needs one.
    int EmitWithConstant(Op op, int a, int constant);
    void EmitNil(int from, int count);
    void EmitReturn(int first, int count) { EmitABC(Op::Return, first, count + 1, 0); }
    void EmitSetList(int base, int itemCount, int toStore);
    void SetLine(int line);  // of the last instruction
    Instruction& At(int pc) { return m_Prototype->m_Code[pc]; }
    Instruction& At(const Expression& e) { return At(e.m_Info); }

    // ---- Jumps
    int EmitJump();
    int MarkTarget();  // the next instruction may be jumped to
    void Join(int& list, int other);
    void PatchTo(int list, int target);
    void PatchHere(int list);
    void FixJump(int pc, int target);

    // ---- Constants
    int AddString(String* text);
    int AddNumber(double number);

    // ---- Registers
    void Reserve(int count);
    void CheckStack(int count);

    // ---- Expressions
    void Discharge(Expression& e);  // variables become values
    void ToNextRegister(Expression& e);
    int ToAnyRegister(Expression& e);
    void ToValue(Expression& e);
    int ToOperand(Expression& e);                   // a register, or a constant that fits
    void SetResultCount(Expression& e, int count);  // of a call or "..."
    void SetOneResult(Expression& e);
    void Store(const Expression& variable, Expression& value);
    void EmitSelf(Expression& object, Expression& key);
    void MakeIndexed(Expression& table, Expression& key);
    void JumpIfFalse(Expression& e);  // falls through when true
    void JumpIfTrue(Expression& e);
    void EmitUnary(UnaryOp op, Expression& e);
    void PrepareBinary(BinaryOp op, Expression& left);  // before the right side is parsed
    void EmitBinary(BinaryOp op, Expression& left, Expression& right);

    // ---- Locals and scopes
    void DeclareLocal(String* name, int index);  // the index-th that waits to become alive
    void ActivateLocals(int count);
    void EndLocals(int keep);
    int FindLocal(String* name) const;  // its register, or -1
    int FindUpValue(String* name, const Expression& where);
    LocalVariable& GetLocal(int i) { return m_Prototype->m_Locals[m_Active[i]]; }
    void EnterBlock(Block& block, bool isLoop);
    void LeaveBlock();
    void MarkUpValue(int level);  // the local at `level` is taken by a closure
    void CheckLimit(int value, int limit, const char* what);
    int AddPrototype(Prototype* prototype);
    void Finish();

    struct UpValueSource {
        Expression::Kind m_Kind;
        int m_Info;
    };

    // ---- Data, the parser's as well
    Prototype* m_Prototype;
    FunctionCode* m_Outer;
    Block* m_Block = nullptr;
    int m_Pc = 0;
    int m_FreeRegister = 0;
    int m_ActiveCount = 0;
    UpValueSource m_UpValues[kMaxUpValues];

private:
    int& GetJumpOffset(int pc);
    int GetJump(int pc) const;
    Instruction& GetControl(int pc);
    bool PatchTest(int node, int reg);
    void DropValues(int list);
    void PatchList(int list, int valueTarget, int reg, int defaultTarget);
    void PatchWaiting();
    bool NeedsValue(int list);
    int EmitCondition(Op op, int a, int b, int c);
    int EmitLabel(int a, int b, int jump);
    int JumpOn(Expression& e, bool condition);
    void InvertJump(const Expression& e);
    void DischargeToRegister(Expression& e, int reg);
    void DischargeToAnyRegister(Expression& e);
    void ToRegister(Expression& e, int reg);
    void FreeRegister(int reg);
    void Free(const Expression& e);
    void EmitNot(Expression& e);
    void EmitArithmetic(Op op, Expression& a, Expression& b);
    void EmitComparison(Op op, bool condition, Expression& a, Expression& b);
    int AddConstant(const Value& key, const Value& value);

    Lexer& m_Lexer;
    State& m_State;
    Table* m_ConstantIndex;  // where a constant stands
    int m_LastTarget = kNoJump;
    int m_Waiting = kNoJump;  // jumps to the next instruction
    int m_CodeCapacity = 0;
    int m_LineCapacity = 0;
    int m_ConstantCapacity = 0;
    int m_PrototypeCapacity = 0;
    int m_LocalCapacity = 0;
    int m_UpValueCapacity = 0;
    bool m_IsFinished = false;
    std::vector<int> m_ListNumbers;  // places of words that are numbers of a SetList's items
    uint16_t m_Active[kMaxLocals];   // the locals alive, as indices into the prototype's
};

}  // namespace Korvel::TextForm

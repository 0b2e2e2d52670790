// The instruction format: 6 bits for the operation, then 8 bits A, and 9 bits C and B or 18 bits
// Bx. sBx is Bx less kMaxSignedBx. B and C with bit 8 set name a constant where the operation takes
// "RK" operands.
#pragma once

#include <cstdint>

#include "textform/Value.h"

namespace Korvel::TextForm {

enum class Op : uint8_t {
    Move,       // A B     R(A) = R(B)
    LoadK,      // A Bx    R(A) = K(Bx)
    LoadBool,   // A B C   R(A) = B; if C skip the next
    LoadNil,    // A B     R(A) ... R(B) = nil
    GetUpVal,   // A B     R(A) = U[B]
    GetGlobal,  // A Bx    R(A) = G[K(Bx)]
    GetTable,   // A B C   R(A) = R(B)[RK(C)]
    SetGlobal,  // A Bx    G[K(Bx)] = R(A)
    SetUpVal,   // A B     U[B] = R(A)
    SetTable,   // A B C   R(A)[RK(B)] = RK(C)
    NewTable,   // A B C   R(A) = {} with sizes B (8 bits; bit 8: compact) and C
    Self,       // A B C   R(A+1) = R(B); R(A) = R(B)[RK(C)]
    Add,        // A B C   R(A) = RK(B) + RK(C)
    Sub,
    Mul,
    Div,
    Mod,
    Pow,
    Unm,  // A B     R(A) = -R(B)
    Not,
    Len,
    Concat,  // A B C   R(A) = R(B) .. ... .. R(C)
    Jmp,     // sBx     pc += sBx
    Eq,      // A B C   if (RK(B) == RK(C)) != A skip the next
    Lt,
    Le,
    Test,     // A C     if not (R(A) <=> C) skip the next
    TestSet,  // A B C   if R(B) <=> C then R(A) = R(B) else skip the next
    Call,     // A B C   R(A) ... R(A+C-2) = R(A)(R(A+1) ... R(A+B-1))
    TailCall,
    Return,    // A B     return R(A) ... R(A+B-2)
    ForLoop,   // A sBx   R(A) += R(A+2); if in range { pc += sBx; R(A+3) = R(A) }
    ForPrep,   // A sBx   R(A) -= R(A+2); pc += sBx
    TForLoop,  // A C     R(A+3) ... R(A+2+C) = R(A)(R(A+1), R(A+2)); if nil skip the next
    SetList,   // A B C   R(A)[(C-1) * 50 + i] = R(A+i) for 1 <= i <= B
    Close,     // A       close up-values from R(A) on
    Closure,   // A Bx    R(A) = closure of P(Bx); a Move or GetUpVal follows for each up-value
    Vararg,    // A B     R(A) ... R(A+B-2) = ...
    PreloadK,  // Bx      the upper bits for the constant of the next instruction
    TForPrep,  // A sBx   a table in R(A) becomes next, table; pc += sBx
    Count,
};

inline constexpr int kOpCount = static_cast<int>(Op::Count);
inline constexpr int kMaxA = 255;
inline constexpr int kMaxB = 511;
inline constexpr int kMaxC = 511;
inline constexpr int kMaxBx = (1 << 18) - 1;
inline constexpr int kMaxSignedBx = kMaxBx >> 1;
inline constexpr int kConstantBit = 256;
inline constexpr int kMaxRkIndex = 255;
inline constexpr int kCompactBit = 256;  // of NewTable's B
inline constexpr int kFieldsPerFlush = 50;
inline constexpr int kNoJump = -1;
inline constexpr int kAllResults = -1;

inline constexpr Op GetOp(Instruction i) {
    return static_cast<Op>(i & 63);
}
inline constexpr int GetA(Instruction i) {
    return i >> 6 & 255;
}
inline constexpr int GetB(Instruction i) {
    return static_cast<int>(i >> 23);
}
inline constexpr int GetC(Instruction i) {
    return i >> 14 & 511;
}
inline constexpr int GetBx(Instruction i) {
    return static_cast<int>(i >> 14);
}
inline constexpr int GetSignedBx(Instruction i) {
    return GetBx(i) - kMaxSignedBx;
}

inline constexpr Instruction MakeABC(Op op, int a, int b, int c) {
    return static_cast<Instruction>(op) | static_cast<Instruction>(a) << 6 |
           static_cast<Instruction>(b) << 23 | static_cast<Instruction>(c) << 14;
}
inline constexpr Instruction MakeABx(Op op, int a, int bx) {
    return static_cast<Instruction>(op) | static_cast<Instruction>(a) << 6 |
           static_cast<Instruction>(bx) << 14;
}
inline constexpr void SetOp(Instruction& i, Op op) {
    i = (i & ~63u) | static_cast<Instruction>(op);
}
inline constexpr void SetA(Instruction& i, int a) {
    i = (i & ~(255u << 6)) | static_cast<Instruction>(a) << 6;
}
inline constexpr void SetB(Instruction& i, int b) {
    i = (i & ~(511u << 23)) | static_cast<Instruction>(b) << 23;
}
inline constexpr void SetC(Instruction& i, int c) {
    i = (i & ~(511u << 14)) | static_cast<Instruction>(c) << 14;
}
inline constexpr void SetSignedBx(Instruction& i, int sbx) {
    i = (i & 0x3FFFu) | static_cast<Instruction>(sbx + kMaxSignedBx) << 14;
}

inline constexpr bool IsConstant(int rk) {
    return (rk & kConstantBit) != 0;
}
inline constexpr int GetConstantIndex(int rk) {
    return rk & ~kConstantBit;
}

// What the operands of an operation are.
enum class Format : uint8_t { ABC, ABx, AsBx };
enum class Operand : uint8_t { Unused, Used, Register, RegisterOrConstant };

// Bits 0 and 1: Format; 2 and 3: C; 4 and 5: B; 6: sets R(A); 7: a test, a jump follows.
uint8_t GetModes(Op op);
inline Format GetFormat(Op op) {
    return static_cast<Format>(GetModes(op) & 3);
}
inline Operand GetOperandC(Op op) {
    return static_cast<Operand>(GetModes(op) >> 2 & 3);
}
inline Operand GetOperandB(Op op) {
    return static_cast<Operand>(GetModes(op) >> 4 & 3);
}
inline bool SetsA(Op op) {
    return (GetModes(op) & 0x40) != 0;
}
inline bool IsTest(Op op) {
    return (GetModes(op) & 0x80) != 0;
}

}  // namespace Korvel::TextForm

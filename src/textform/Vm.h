// The machine's loop, and the operations on values that it shares with native code.
#pragma once

#include <cmath>

#include "textform/Opcodes.h"
#include "textform/State.h"

namespace Korvel::TextForm {

// Runs the script call on the top until it returns to native code, or yields.
void Execute(State& L);

// Replaces the `count` topmost values by their concatenation.
void Concat(State& L, int count);

// The remainder, with the sign of the divisor.
inline double FloorMod(double a, double b) {
    double quotient = a / b;
    double whole;
    // A conversion costs less than the call of floor; zeros keep their sign there.
    if (quotient > -1e15 && quotient < 1e15 && quotient != 0) {
        whole = static_cast<double>(static_cast<int64_t>(quotient));
        if (whole > quotient) whole -= 1;
    } else {
        whole = std::floor(quotient);
    }
    return a - whole * b;
}

// The arithmetic operation of an instruction, on numbers.
double Calculate(Op op, double a, double b);
// The same on any values, with metamethods; stores the result in a slot of the stack.
void Arithmetic(State& L, Op op, const Value* a, const Value* b, Value* result);

bool LessThan(State& L, const Value* a, const Value* b);
bool LessEqual(State& L, const Value* a, const Value* b);
bool EqualValues(State& L, const Value* a, const Value* b);
void GetLengthOf(State& L, const Value* operand, Value* result);

}  // namespace Korvel::TextForm

// The interpreter as its users see it.
//
//     Interpreter interpreter;
//     State& L = interpreter.GetState();
//     OpenBase(L);
//     if (L.LoadBuffer(text, "=text") == Status::Ok) L.ProtectedCall(0, 1);
//     ... L.m_Top[-1] is the result, or the message
#pragma once

#include <cstdint>
#include <span>

#include "textform/State.h"

namespace Korvel::TextForm {

// What foreign text may use up.
struct Limits {
    int64_t m_Instructions;
    size_t m_Bytes;
};

// A machine with its main thread. Lives as long as one reading of a text: everything goes with it.
//
// Ownership: owns all values, so they have to be copied out before.
// Threads:   one at a time; interpreters share nothing.
class Interpreter {
public:
    // Throws std::bad_alloc when there is no memory even for an empty machine.
    Interpreter() : Interpreter(nullptr) {}
    explicit Interpreter(const Limits& limits) : Interpreter(&limits) {}
    Interpreter(const Interpreter&) = delete;
    Interpreter& operator=(const Interpreter&) = delete;
    ~Interpreter();  // calls the finalisers that are left

    State& GetState() { return *m_Machine.m_MainThread; }
    Machine& GetMachine() { return m_Machine; }

private:
    explicit Interpreter(const Limits* limits);

    Machine m_Machine;
};

// ---- Libraries. Each may raise a memory error.
struct NativeEntry {
    const char* m_Name;
    NativeFunction m_Function;
};
// Puts functions into a table, in their order.
void Register(State& L, Table* table, std::span<const NativeEntry> entries);
// The same into a new table, which becomes a global and is pushed.
Table* OpenLibrary(State& L, const char* name, std::span<const NativeEntry> entries);

enum class BaseLevel : uint8_t {
    Full,
    // For foreign text: nothing that compiles, reads files, prints or makes coroutines and
    // userdata.
    Foreign,
};
void OpenBase(State& L, BaseLevel level = BaseLevel::Full);
void OpenString(State& L);  // with the metatable of strings
void OpenTable(State& L);
void OpenMath(State& L);
void OpenCoroutine(State& L);  // part of OpenBase

}  // namespace Korvel::TextForm

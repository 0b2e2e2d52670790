// A thread of execution: a stack of values, a stack of calls, and the operations of native code.
#pragma once

#include <cstdarg>
#include <new>
#include <string_view>

#include "textform/Machine.h"
#include "textform/Table.h"
#include "textform/Value.h"

namespace Korvel::TextForm {

// One call that has not returned.
struct CallInfo {
    Value* m_Function;
    Value* m_Base;            // the first argument, or register 0
    Value* m_Top;             // end of what the call may use
    const Instruction* m_Pc;  // the next instruction, while the call is not the running one
    int m_ResultCount;        // wanted by the caller; -1 for all
    int m_TailCalls;          // calls that ended in this one, and left no trace
    bool m_IsEntry;           // called by native code: the return leaves the machine's loop
};

// A place in the text, for messages: "chunk:line:" and the name a value was called by.
struct CallSite {
    const char* m_Kind;  // "local", "global", "field", "upvalue", "method"; null if not known
    const char* m_Name;
};

// Hands out the next piece of a chunk; null or size 0 at the end. The piece lives until the next
// call.
using ChunkReader = const char* (*)(State& L, void* state, size_t* size);

// Arguments of native code stand from m_Base on and are counted from 1, results are pushed. What a
// native function holds has to stand on the stack when it calls back or raises a step of the
// collector; both happen in Call and its kin only.
//
// Errors are thrown as Raised, and ProtectedCall is what catches them. Owners with destructors may
// stand between.
class State : public Object {
public:
    static constexpr int kMinStack = 20;  // free slots for native code
    static constexpr int kMaxNativeStack = 8000;
    static constexpr int kMaxCalls = 20000;
    static constexpr int kMaxNativeCalls = 200;
    static constexpr int kMaxVarargs = 250;

    Machine& GetMachine() const { return *m_Machine; }

    // ---- Stack
    int GetArgCount() const { return static_cast<int>(m_Top - m_Base); }
    // Argument or local number `i`; g_None beyond the top.
    const Value& Arg(int i) const;
    Type GetArgType(int i) const { return Arg(i).m_Type; }
    void Push(const Value& value) { *m_Top++ = value; }
    void PushNil() { Push(Value::Nil()); }
    void PushNumber(double number) { Push(Value::Number(number)); }
    void PushBoolean(bool value) { Push(Value::Boolean(value)); }
    String* PushString(std::string_view text);
    // %s, %d, %f (a number as programs see it), %c, %p and %%.
    const char* PushFormat(const char* format, ...);
    const char* PushFormatV(const char* format, va_list args);
    void PushFunction(NativeFunction function, int upValueCount = 0);  // takes values off the stack
    Table* PushTable(int arraySize = 0, int nodeCount = 0);
    void Pop(int count = 1) { m_Top -= count; }
    void SetTop(int count);
    void Insert(int i);  // moves the top value to place `i`
    // Grows the stack; any pointer into it is void then.
    void NeedStack(int count) {
        if (m_StackEnd - m_Top <= count) GrowStack(count);
    }
    bool TryNeedStack(int count);                       // false past what native code may use
    void NeedNativeStack(int count, const char* what);  // raises "stack overflow (what)"

    // ---- Arguments: checked, else the error of a bad argument is raised
    double CheckNumber(int i);
    int64_t CheckInteger(int i);
    int CheckInt(int i) { return static_cast<int>(CheckInteger(i)); }
    int64_t OptInteger(int i, int64_t otherwise);
    double OptNumber(int i, double otherwise);
    String* CheckString(int i);  // a number becomes a string in its place
    std::string_view OptString(int i, std::string_view otherwise);
    Table* CheckTable(int i);
    void CheckType(int i, Type type);
    void CheckAny(int i);
    int CheckOption(int i, const char* otherwise, const char* const* options);
    bool IsNoneOrNil(int i) const { return Arg(i).m_Type <= Type::Nil; }
    const Value& GetUpValue(int i) const;  // of the running native function, from 1 on

    // ---- Errors
    [[noreturn]] void Throw(Status status);
    [[noreturn]] void ThrowValue();                       // the top of the stack is the error
    [[noreturn]] void Error(const char* format, ...);     // with the place of the running function
    [[noreturn]] void RunError(const char* format, ...);  // the same, for the machine's own errors
    [[noreturn]] void ArgError(int i, const char* message);
    [[noreturn]] void TypeError(int i, const char* typeName);
    [[noreturn]] void OperandError(const Value* operand, const char* operation);
    [[noreturn]] void ArithmeticError(const Value* a, const Value* b);
    [[noreturn]] void ConcatError(const Value* a, const Value* b);
    [[noreturn]] void CompareError(const Value* a, const Value* b);
    void PushWhere(int level);  // "chunk:line: " or ""

    // ---- Calls
    // Calls the function below its arguments, and replaces them by the results.
    void Call(int argCount, int resultCount);
    void CallAt(Value* function, int resultCount);
    // The same, protected: on failure the error stands in the place of the function. `handler` is
    // the place of a function on the stack that sees the error first, or null.
    Status ProtectedCall(int argCount, int resultCount, const Value* handler = nullptr);
    // Runs native code, protected: on failure the error stands at `oldTop`, the new top but one.
    template <class Function>
    Status RunProtected(Function function, Value* oldTop, ptrdiff_t handler) {
        Guard guard(*this, oldTop, handler);
        try {
            function();
            return guard.End(Status::Ok);
        } catch (const Raised& raised) {
            return guard.End(raised.m_Status);
        } catch (const std::bad_alloc&) {
            return guard.End(Status::MemoryError);
        }
    }
    // Compiles text or loads a binary chunk; pushes the function, or the message.
    Status Load(ChunkReader reader, void* readerState, const char* chunkName,
                bool allowBinary = true);
    Status LoadBuffer(std::string_view text, const char* chunkName, bool allowBinary = true);

    Status Resume(State& from, int argCount);
    int Yield(int resultCount);

    // ---- Values, with metamethods
    void GetIndex(const Value& object, const Value& key, Value* result);
    void SetIndex(const Value& object, const Value& key, const Value& value);
    bool Equals(const Value& a, const Value& b);
    bool Less(const Value& a, const Value& b);
    bool CallMeta(int i, std::string_view event);  // pushes the result, if there is such a method
    bool GetMetaField(int i, std::string_view event);
    void SetRaw(Table* table, const Value& key, const Value& value);
    void SetRaw(Table* table, int key, const Value& value);
    void SetField(Table* table, std::string_view name, const Value& value);
    void PushField(Table* table, std::string_view name);
    // Whether a value is a number or a text that reads as one.
    static bool ToNumber(const Value& value, double& number);
    // The same for values of any length: reading takes time.
    bool ReadNumber(const Value& value, double& number) {
        if (value.IsString()) Charge(value.AsString()->m_Length / 64);
        return ToNumber(value, number);
    }
    bool ToString(Value* place);  // makes a number a string

    // ---- Limits
    // Counts work that takes longer than an instruction.
    void Charge(size_t work) {
        if (m_Machine->m_IsLimited) m_Machine->Spend(work);
    }
    // An access to an ordered table walks along its entries.
    void ChargeAccess(const Table* table) {
        if (m_Machine->m_IsLimited && !table->IsHashed()) m_Machine->Spend(table->CountNodes() / 8);
    }

    // ---- Levels of calls, as programs count them
    struct Level {
        CallInfo* m_Call;  // null: lost in a tail call
    };
    bool GetLevel(int level, Level& found) const;
    int GetCurrentLine(const CallInfo* call) const;
    CallSite GetCallSite(const CallInfo* call) const;  // what the function was called by

    bool TakeHashState() {
        bool hashed = m_HashState != 0;
        m_HashState = 1;
        return hashed;
    }

    // ---- Data; the machine's loop, the collector and the errors share it
    Machine* m_Machine;
    Value* m_Stack;
    Value* m_Base;  // of the running call
    Value* m_Top;
    Value* m_StackEnd;  // a few slots before the real end
    CallInfo* m_Call;
    CallInfo* m_Calls;
    CallInfo* m_CallsEnd;
    Table* m_Globals;
    UpValue* m_OpenUpValues;
    Object* m_GcList;
    State* m_NextThread;
    State** m_ThreadLink;
    int m_StackSize;
    ptrdiff_t m_Handler;  // of errors: bytes from the begin of the stack, 0 for none
    uint8_t m_HashState;  // 0: the next table is ordered
    Status m_Status;
    uint16_t m_NativeCalls;
    uint16_t m_BaseNativeCalls;  // when the coroutine was resumed

    // What stands beyond the end of the stack for error handling.
    static constexpr int kExtraStack = 5;

    void GrowStack(int count);
    void ResizeStack(int size);
    void ShrinkStacks(const Value* end);  // gives back half of what is far too large
    void CloseUpValues(Value* level);
    CallInfo* PushCall() {
        if (++m_Call >= m_CallsEnd) GrowCalls();
        return m_Call;
    }
    // What a protected call puts back.
    class Guard {
    public:
        Guard(State& L, Value* oldTop, ptrdiff_t handler);
        Status End(Status status);

    private:
        State& m_State;
        ptrdiff_t m_OldTop;
        ptrdiff_t m_OldHandler;
        ptrdiff_t m_OldCall;
        uint16_t m_OldNativeCalls;
    };
    // Bytes from the begin of the stack, which may move.
    ptrdiff_t GetOffset(const Value* place) const {
        return reinterpret_cast<const char*>(place) - reinterpret_cast<const char*>(m_Stack);
    }
    Value* GetPlace(ptrdiff_t offset) const {
        return reinterpret_cast<Value*>(reinterpret_cast<char*>(m_Stack) + offset);
    }
    enum class Called : uint8_t { Script, Native, Yielded };
    Called Enter(Value* function, int resultCount);
    bool Leave(Value* firstResult);  // true if a fixed number of results was wanted

private:
    void GrowCalls();
    void ResizeCalls(int count);
    void SetErrorValue(Status status, Value* place);
    Value* UseCallMetamethod(Value* function);
    void ResumeBody(Value* firstArg);
    Status FailResume(const char* message);
    Value* AdjustVarargs(const Prototype* prototype, int argCount);
    void ShrinkCalls();
};

extern const Value g_None;

State* NewThread(Machine& machine, Table* globals);
void FreeThread(Machine& machine, State* thread);  // closes its open up-values
UpValue* FindUpValue(State& L, Value* place);
UpValue* NewClosedUpValue(Machine& machine);
void FreeUpValue(Machine& machine, UpValue* upValue);
ScriptClosure* NewScriptClosure(Machine& machine, Prototype* prototype, Table* environment);
NativeClosure* NewNativeClosure(Machine& machine, NativeFunction f, int upValues, Table* env);
void FreeClosure(Machine& machine, Closure* closure);
Prototype* NewPrototype(Machine& machine);
void FreePrototype(Machine& machine, Prototype* prototype);
Userdata* NewUserdata(Machine& machine, size_t size, Table* environment);

}  // namespace Korvel::TextForm

#include "textform/Interpreter.h"
#include "textform/Opcodes.h"
#include "textform/Vm.h"

namespace Korvel::TextForm {

namespace {

enum Condition { Running, Suspended, Normal, Dead };
constexpr const char* kConditionNames[] = {"running", "suspended", "normal", "dead"};

Condition GetCondition(State& L, State* thread) {
    if (&L == thread) return Running;
    if (thread->m_Status == Status::Yield) return Suspended;
    if (thread->m_Status != Status::Ok) return Dead;
    if (thread->m_Call != thread->m_Calls) return Normal;  // it has resumed another one
    return thread->m_Top == thread->m_Base ? Dead : Suspended;
}

State* CheckThread(State& L) {
    if (!L.Arg(1).Is(Type::Thread)) L.ArgError(1, "coroutine expected");
    return static_cast<State*>(L.Arg(1).m_Object);
}

void Move(State& from, State& to, int count) {
    from.m_Top -= count;
    for (int i = 0; i < count; i++) to.Push(from.m_Top[i]);
}

// Passes arguments on, and results back onto the stack. Less than 0 for an error, which is pushed.
int ResumeWith(State& L, State* thread, int argCount) {
    Condition condition = GetCondition(L, thread);
    if (!thread->TryNeedStack(argCount)) L.Error("too many arguments to resume");
    if (condition != Suspended) {
        L.PushFormat("cannot resume %s coroutine", kConditionNames[condition]);
        return -1;
    }
    Move(L, *thread, argCount);
    Status status = thread->Resume(L, argCount);
    if (status == Status::LimitError) L.Throw(status);
    if (status != Status::Ok && status != Status::Yield) {
        Move(*thread, L, 1);
        return -1;
    }
    int count = thread->GetArgCount();
    if (!L.TryNeedStack(count + 1)) L.Error("too many results to resume");
    Move(*thread, L, count);
    return count;
}

int CoroutineResume(State& L) {
    State* thread = CheckThread(L);
    int count = ResumeWith(L, thread, L.GetArgCount() - 1);
    bool isGood = count >= 0;
    if (!isGood) count = 1;
    L.PushBoolean(isGood);
    L.Insert(L.GetArgCount() - count);
    return count + 1;
}

int WrapStep(State& L) {
    auto* thread = static_cast<State*>(L.GetUpValue(1).m_Object);
    int count = ResumeWith(L, thread, L.GetArgCount());
    if (count >= 0) return count;
    if (L.m_Top[-1].IsString() || L.m_Top[-1].IsNumber()) {  // say where, too
        L.PushWhere(1);
        L.Insert(L.GetArgCount() - 1);
        Concat(L, 2);
    }
    L.ThrowValue();
}

int CoroutineCreate(State& L) {
    if (!L.Arg(1).IsFunction() || L.Arg(1).AsFunction()->IsNative()) {
        L.ArgError(1, "Lua function expected");
    }
    State* thread = NewThread(L.GetMachine(), L.m_Globals);
    L.Push(Value::Of(static_cast<Object*>(thread)));
    thread->Push(L.Arg(1));
    return 1;
}

int CoroutineWrap(State& L) {
    CoroutineCreate(L);
    L.PushFunction(WrapStep, 1);
    return 1;
}

int CoroutineYield(State& L) {
    return L.Yield(L.GetArgCount());
}

int CoroutineStatus(State& L) {
    L.PushString(kConditionNames[GetCondition(L, CheckThread(L))]);
    return 1;
}

int CoroutineRunning(State& L) {
    if (&L == L.GetMachine().m_MainThread) {
        L.PushNil();
    } else {
        L.Push(Value::Of(static_cast<Object*>(&L)));
    }
    return 1;
}

constexpr NativeEntry kFunctions[] = {
    {"create", CoroutineCreate}, {"resume", CoroutineResume}, {"running", CoroutineRunning},
    {"status", CoroutineStatus}, {"wrap", CoroutineWrap},     {"yield", CoroutineYield},
};

}  // namespace

void OpenCoroutine(State& L) {
    OpenLibrary(L, "coroutine", kFunctions);
    L.Pop();
}

}  // namespace Korvel::TextForm

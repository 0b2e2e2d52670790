// Making and freeing of functions, their up-values, userdata and threads.
#include <algorithm>

#include "textform/State.h"

namespace Korvel::TextForm {

Prototype* NewPrototype(Machine& machine) {
    auto* p = machine.NewObject<Prototype>(Type::Prototype);
    memset(static_cast<void*>(&p->m_Constants), 0,
           sizeof(Prototype) - offsetof(Prototype, m_Constants));
    return p;
}

void FreePrototype(Machine& machine, Prototype* p) {
    machine.FreeArray(p->m_Constants, p->m_ConstantCount);
    machine.FreeArray(p->m_Code, p->m_CodeCount);
    machine.FreeArray(p->m_Prototypes, p->m_PrototypeCount);
    machine.FreeArray(p->m_Lines, p->m_LineCount);
    machine.FreeArray(p->m_Locals, p->m_LocalCount);
    machine.FreeArray(p->m_UpValueNames, p->m_UpValueNameCount);
    machine.FreeBytes(p, sizeof(Prototype));
}

static size_t GetClosureSize(bool isNative, int upValueCount) {
    return isNative ? sizeof(NativeClosure) + upValueCount * sizeof(Value)
                    : sizeof(ScriptClosure) + upValueCount * sizeof(UpValue*);
}

ScriptClosure* NewScriptClosure(Machine& machine, Prototype* prototype, Table* environment) {
    int count = prototype->m_UpValueCount;
    auto* c = machine.NewObject<ScriptClosure>(Type::Function, GetClosureSize(false, count));
    c->m_Extra = 0;
    c->m_Environment = environment;
    c->m_GcList = nullptr;
    c->m_UpValueCount = count;
    c->m_Prototype = prototype;
    std::fill_n(c->GetUpValues(), count, nullptr);
    return c;
}

NativeClosure* NewNativeClosure(Machine& machine, NativeFunction function, int upValueCount,
                                Table* environment) {
    auto* c = machine.NewObject<NativeClosure>(Type::Function, GetClosureSize(true, upValueCount));
    c->m_Extra = 1;
    c->m_Environment = environment;
    c->m_GcList = nullptr;
    c->m_UpValueCount = upValueCount;
    c->m_Function = function;
    std::fill_n(c->GetUpValues(), upValueCount, g_Nil);
    return c;
}

void FreeClosure(Machine& machine, Closure* c) {
    machine.FreeBytes(c, GetClosureSize(c->IsNative(), c->m_UpValueCount));
}

static void Unlink(UpValue* upValue) {
    *upValue->m_Link = upValue->m_NextOpen;
    if (upValue->m_NextOpen) upValue->m_NextOpen->m_Link = upValue->m_Link;
    upValue->m_Link = nullptr;
}

UpValue* FindUpValue(State& L, Value* place) {
    UpValue** link = &L.m_OpenUpValues;
    for (UpValue* open; (open = *link) && open->m_Place >= place; link = &open->m_NextOpen) {
        if (open->m_Place != place) continue;
        L.GetMachine().Revive(open);
        return open;
    }
    auto* upValue = L.GetMachine().NewObject<UpValue>(Type::UpValue);
    upValue->m_Place = place;
    upValue->m_NextOpen = *link;
    upValue->m_Link = link;
    if (*link) (*link)->m_Link = &upValue->m_NextOpen;
    *link = upValue;
    return upValue;
}

UpValue* NewClosedUpValue(Machine& machine) {
    auto* upValue = machine.NewObject<UpValue>(Type::UpValue);
    upValue->m_Closed = g_Nil;
    upValue->m_Place = &upValue->m_Closed;
    upValue->m_NextOpen = nullptr;
    upValue->m_Link = nullptr;
    return upValue;
}

void FreeUpValue(Machine& machine, UpValue* upValue) {
    if (upValue->m_Link) Unlink(upValue);
    machine.FreeBytes(upValue, sizeof(UpValue));
}

void State::CloseUpValues(Value* level) {
    while (m_OpenUpValues && m_OpenUpValues->m_Place >= level) {
        UpValue* upValue = m_OpenUpValues;
        Unlink(upValue);
        upValue->m_Closed = *upValue->m_Place;
        upValue->m_Place = &upValue->m_Closed;
        m_Machine->BarrierClosed(upValue);
    }
}

Userdata* NewUserdata(Machine& machine, size_t size, Table* environment) {
    auto* u = static_cast<Userdata*>(machine.NewBytes(sizeof(Userdata) + size));
    u->m_Type = Type::Userdata;
    u->m_Marks = machine.m_White;
    u->m_Next = machine.m_Userdata;
    machine.m_Userdata = u;
    u->m_Metatable = nullptr;
    u->m_Environment = environment;
    u->m_Size = size;
    return u;
}

State* NewThread(Machine& machine, Table* globals) {
    constexpr int kFirstStack = 2 * State::kMinStack;
    constexpr int kFirstCalls = 8;
    auto* stack = machine.NewArray<Value>(kFirstStack + State::kExtraStack);
    CallInfo* calls = nullptr;
    State* L = nullptr;
    try {
        calls = machine.NewArray<CallInfo>(kFirstCalls);
        L = machine.NewObject<State>(Type::Thread);
    } catch (const Raised&) {
        machine.FreeArray(calls, kFirstCalls);
        machine.FreeArray(stack, kFirstStack + State::kExtraStack);
        throw;
    }
    std::fill_n(stack, kFirstStack + State::kExtraStack, g_Nil);
    L->m_Machine = &machine;
    L->m_Stack = stack;
    L->m_StackSize = kFirstStack + State::kExtraStack;
    L->m_StackEnd = stack + kFirstStack - 1;
    L->m_Calls = L->m_Call = calls;
    L->m_CallsEnd = calls + kFirstCalls;
    L->m_Globals = globals;
    L->m_OpenUpValues = nullptr;
    L->m_GcList = nullptr;
    L->m_Handler = 0;
    L->m_HashState = 1;
    L->m_Status = Status::Ok;
    L->m_NativeCalls = L->m_BaseNativeCalls = 0;
    *calls = {stack, stack + 1, stack + 1 + State::kMinStack, nullptr, 0, 0, false};
    L->m_Base = L->m_Top = stack + 1;
    L->m_NextThread = machine.m_Threads;
    L->m_ThreadLink = &machine.m_Threads;
    if (machine.m_Threads) machine.m_Threads->m_ThreadLink = &L->m_NextThread;
    machine.m_Threads = L;
    return L;
}

void FreeThread(Machine& machine, State* L) {
    L->CloseUpValues(L->m_Stack);
    *L->m_ThreadLink = L->m_NextThread;
    if (L->m_NextThread) L->m_NextThread->m_ThreadLink = L->m_ThreadLink;
    machine.FreeArray(L->m_Calls, L->m_CallsEnd - L->m_Calls);
    machine.FreeArray(L->m_Stack, L->m_StackSize);
    machine.FreeBytes(L, sizeof(State));
}

}  // namespace Korvel::TextForm

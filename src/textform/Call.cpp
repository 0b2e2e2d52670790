// Calls, protected calls and coroutines; the growth of both stacks.
#include <algorithm>

#include "textform/State.h"
#include "textform/Vm.h"

namespace Korvel::TextForm {

// ---- Stacks

void State::ResizeStack(int size) {
    Value* old = m_Stack;
    int realSize = size + 1 + kExtraStack;
    m_Stack = m_Machine->ResizeArray(m_Stack, m_StackSize, realSize);
    for (int i = m_StackSize; i < realSize; i++) m_Stack[i] = g_Nil;
    m_StackSize = realSize;
    m_StackEnd = m_Stack + size;
    m_Top = m_Stack + (m_Top - old);
    m_Base = m_Stack + (m_Base - old);
    for (UpValue* open = m_OpenUpValues; open; open = open->m_NextOpen) {
        open->m_Place = m_Stack + (open->m_Place - old);
    }
    for (CallInfo* call = m_Calls; call <= m_Call; call++) {
        call->m_Function = m_Stack + (call->m_Function - old);
        call->m_Base = m_Stack + (call->m_Base - old);
        call->m_Top = m_Stack + (call->m_Top - old);
    }
}

void State::GrowStack(int count) {
    int size = static_cast<int>(m_StackEnd - m_Stack);
    ResizeStack(count <= size ? size * 2 : size + count);
}

void State::ResizeCalls(int count) {
    ptrdiff_t place = m_Call - m_Calls;
    m_Calls = m_Machine->ResizeArray(m_Calls, m_CallsEnd - m_Calls, count);
    m_CallsEnd = m_Calls + count;
    m_Call = m_Calls + place;
}

// m_Call is one past the last that fits.
void State::GrowCalls() {
    auto size = static_cast<int>(m_CallsEnd - m_Calls);
    m_Call--;
    if (size > kMaxCalls) Throw(Status::HandlerError);  // no place even for the handler
    ResizeCalls(size * 2);
    if (size * 2 > kMaxCalls) RunError("stack overflow");
    m_Call++;
}

void State::ShrinkCalls() {
    auto size = static_cast<int>(m_CallsEnd - m_Calls);
    if (size > kMaxCalls && m_Call - m_Calls + 1 < kMaxCalls) ResizeCalls(kMaxCalls);
}

void State::ShrinkStacks(const Value* end) {
    auto calls = static_cast<int>(m_CallsEnd - m_Calls);
    if (calls > kMaxCalls) return;  // an overflow is being handled
    if (m_Call - m_Calls < calls / 4 && calls > 16) ResizeCalls(calls / 2);
    auto size = static_cast<int>(m_StackEnd - m_Stack);
    if (end - m_Stack < size / 4 && size > 4 * kMinStack) ResizeStack(size / 2);
}

bool State::TryNeedStack(int count) {
    if (count > kMaxNativeStack || m_Top - m_Base + count > kMaxNativeStack) return false;
    if (count > 0) {
        NeedStack(count);
        m_Call->m_Top = std::max(m_Call->m_Top, m_Top + count);
    }
    return true;
}

void State::NeedNativeStack(int count, const char* what) {
    if (!TryNeedStack(count)) Error("stack overflow (%s)", what);
}

// ---- Calls

// Puts the method for calls below the arguments.
Value* State::UseCallMetamethod(Value* function) {
    const Value method = *m_Machine->GetMeta(*function, Event::Call);
    if (!method.IsFunction()) OperandError(function, "call");
    ptrdiff_t offset = GetOffset(function);
    for (Value* p = m_Top; p > function; p--) *p = p[-1];
    m_Top++;
    NeedStack(0);
    function = GetPlace(offset);
    *function = method;
    return function;
}

// Moves the fixed parameters above the arguments, which stay below as "...".
Value* State::AdjustVarargs(const Prototype* prototype, int argCount) {
    int fixedCount = prototype->m_ParameterCount;
    for (; argCount < fixedCount; argCount++) PushNil();
    Table* arg = nullptr;
    if (prototype->m_VarargFlags & Prototype::kNeedsArg) {
        int count = argCount - fixedCount;
        m_Machine->CheckGc(*this);
        NeedStack(prototype->m_MaxStackSize);
        arg = NewTable(*this, count, 1);
        for (int i = 0; i < count; i++) *SetSlot(*this, arg, i + 1) = m_Top[i - count];
        *SetSlot(*this, arg, m_Machine->NewString("n")) = Value::Number(count);
    }
    Value* base = m_Top;
    Value* fixed = m_Top - argCount;
    for (int i = 0; i < fixedCount; i++) {
        Push(fixed[i]);
        fixed[i] = g_Nil;
    }
    if (arg) Push(Value::Of(arg));
    return base;
}

State::Called State::Enter(Value* function, int resultCount) {
    if (!function->IsFunction()) function = UseCallMetamethod(function);
    Closure* closure = function->AsFunction();
    if (closure->IsNative()) {
        ptrdiff_t offset = GetOffset(function);
        m_Machine->CheckGc(*this);
        NeedStack(kMinStack);
        CallInfo* call = PushCall();
        function = GetPlace(offset);
        *call = {function, function + 1, m_Top + kMinStack, nullptr, resultCount, 0, false};
        m_Base = call->m_Base;
        int count = AsNative(closure)->m_Function(*this);
        if (count < 0) return Called::Yielded;
        Leave(m_Top - count);
        return Called::Native;
    }
    const Prototype* p = AsScript(closure)->m_Prototype;
    ptrdiff_t offset = GetOffset(function);
    NeedStack(p->m_MaxStackSize + p->m_ParameterCount);
    function = GetPlace(offset);
    Value* base = function + 1;
    if (!p->m_VarargFlags) {
        m_Top = std::min(m_Top, base + p->m_ParameterCount);
    } else {
        base = AdjustVarargs(p, static_cast<int>(m_Top - base));
        function = GetPlace(offset);
    }
    ptrdiff_t baseOffset = GetOffset(base);
    CallInfo* call = PushCall();
    base = GetPlace(baseOffset);
    function = GetPlace(offset);
    Value* top = base + p->m_MaxStackSize;
    *call = {function, base, top, p->m_Code, resultCount, 0, false};
    for (Value* p2 = m_Top; p2 < top; p2++) *p2 = g_Nil;
    m_Base = base;
    m_Top = top;
    return Called::Script;
}

bool State::Leave(Value* result) {
    CallInfo* call = m_Call--;
    m_Base = m_Call->m_Base;
    Value* place = call->m_Function;
    int wanted = call->m_ResultCount;
    int missing = wanted;
    for (; missing != 0 && result < m_Top; missing--) *place++ = *result++;
    for (; missing > 0; missing--) *place++ = g_Nil;
    m_Top = place;
    return wanted != kAllResults;
}

void State::CallAt(Value* function, int resultCount) {
    if (++m_NativeCalls >= kMaxNativeCalls) {
        if (m_NativeCalls == kMaxNativeCalls) RunError("C stack overflow");
        if (m_NativeCalls >= kMaxNativeCalls + kMaxNativeCalls / 8) Throw(Status::HandlerError);
    }
    if (Enter(function, resultCount) == Called::Script) {
        m_Call->m_IsEntry = true;
        Execute(*this);
    }
    m_NativeCalls--;
}

void State::Call(int argCount, int resultCount) {
    CallAt(m_Top - (argCount + 1), resultCount);
    if (resultCount == kAllResults && m_Top >= m_Call->m_Top) m_Call->m_Top = m_Top;
}

// ---- Protected calls

State::Guard::Guard(State& L, Value* oldTop, ptrdiff_t handler)
    : m_State(L),
      m_OldTop(L.GetOffset(oldTop)),
      m_OldHandler(L.m_Handler),
      m_OldCall(L.m_Call - L.m_Calls),
      m_OldNativeCalls(L.m_NativeCalls) {
    L.m_Handler = handler;
}

Status State::Guard::End(Status status) {
    State& L = m_State;
    if (status != Status::Ok) {
        Value* oldTop = L.GetPlace(m_OldTop);
        L.CloseUpValues(oldTop);
        L.SetErrorValue(status, oldTop);
        L.m_Call = L.m_Calls + m_OldCall;
        L.m_Base = L.m_Call->m_Base;
        L.m_NativeCalls = m_OldNativeCalls;
        L.ShrinkCalls();
    }
    L.m_Handler = m_OldHandler;
    return status;
}

// Copies the error to `place` and makes that the last one.
void State::SetErrorValue(Status status, Value* place) {
    switch (status) {
        case Status::MemoryError:
            *place = Value::Of(m_Machine->m_MemoryMessage);
            break;
        case Status::HandlerError:
            *place = Value::Of(m_Machine->m_HandlerMessage);
            break;
        case Status::LimitError:
            *place =
                Value::Of(m_Machine->m_Exceeded == Status::MemoryError ? m_Machine->m_MemoryMessage
                                                                       : m_Machine->m_LimitMessage);
            break;
        default:
            *place = m_Top[-1];
    }
    m_Top = place + 1;
}

Status State::ProtectedCall(int argCount, int resultCount, const Value* handler) {
    Value* function = m_Top - (argCount + 1);
    ptrdiff_t handlerOffset = handler ? GetOffset(handler) : 0;
    Status status = RunProtected([&] { CallAt(function, resultCount); }, function, handlerOffset);
    if (resultCount == kAllResults && m_Top >= m_Call->m_Top) m_Call->m_Top = m_Top;
    return status;
}

// ---- Coroutines

Status State::FailResume(const char* message) {
    m_Top = m_Call->m_Base;
    PushString(message);
    return Status::RunError;
}

void State::ResumeBody(Value* firstArg) {
    if (m_Status == Status::Ok) {
        if (Enter(firstArg - 1, kAllResults) != Called::Script) return;
        m_Call->m_IsEntry = true;
    } else {
        m_Status = Status::Ok;
        if (Leave(firstArg)) m_Top = m_Call->m_Top;
        if (m_Call == m_Calls) return;  // the function itself was yield
    }
    Execute(*this);
}

Status State::Resume(State& from, int argCount) {
    if (m_Status != Status::Yield && (m_Status != Status::Ok || m_Call != m_Calls)) {
        return FailResume("cannot resume non-suspended coroutine");
    }
    m_NativeCalls = from.m_NativeCalls;
    if (m_NativeCalls >= kMaxNativeCalls) return FailResume("C stack overflow");
    m_BaseNativeCalls = ++m_NativeCalls;
    Status status = Status::Ok;
    try {
        ResumeBody(m_Top - argCount);
        status = m_Status;
    } catch (const Raised& raised) {
        status = raised.m_Status;
    } catch (const std::bad_alloc&) {
        status = Status::MemoryError;
    }
    if (status > Status::Yield) {
        m_Status = status;  // it is dead
        SetErrorValue(status, m_Top);
        m_Call->m_Top = m_Top;
    }
    m_NativeCalls--;
    return status;
}

int State::Yield(int resultCount) {
    if (m_NativeCalls > m_BaseNativeCalls) {
        RunError("attempt to yield across metamethod/C-call boundary");
    }
    m_Base = m_Top - resultCount;  // what is below stays
    m_Status = Status::Yield;
    return -1;
}

}  // namespace Korvel::TextForm

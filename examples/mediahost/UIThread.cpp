#include "UIThread.h"

#include "Platform/Events.h"
#include "Platform/Threads.h"
#include "objects/ScriptConfig.h"

using namespace Korvel;

namespace {

struct Call : KorvelScript::QueueNode {
    Call(UIThread::Function function, void* a, void* b, bool isAwaited)
        : QueueNode(0), m_Function(function), m_A(a), m_B(b), m_IsAwaited(isAwaited) {}

    // The end of a call: back to who waits for it.
    void Reply() override {
        if (m_IsAwaited) {
            m_IsDone.Signal();
        } else {
            delete this;
        }
    }

    const UIThread::Function m_Function;
    void* const m_A;
    void* const m_B;
    const bool m_IsAwaited;
    unsigned long long m_Result = 0;
    KorvelScript::Event m_IsDone;
};

}  // namespace

// Whoever asks IsGUIThread from here on gets the right answer.
UIThread::UIThread() : m_Thread([this] { Run(); }) {
    m_IsReady.Wait(Platform::kNoTimeLimit);
}

UIThread::~UIThread() {
    auto end = [](void* mustEnd, void*) -> unsigned long long {
        return *static_cast<bool*>(mustEnd) = true;
    };
    Execute(end, &m_MustEnd, nullptr, true);
    m_Thread.join();
}

unsigned long long UIThread::Execute(Function function, void* a, void* b, bool wait) {
    if (!wait) {
        m_Queue.Put(new Call(function, a, b, false));
        return 0;
    }
    if (IsGUIThread()) return function(a, b);
    Call call(function, a, b, true);
    m_Queue.Put(&call);
    call.m_IsDone.Wait(Platform::kNoTimeLimit);
    return call.m_Result;
}

void UIThread::Run() {
    Platform::InitThread();
    Platform::SetThreadName("UI", nullptr);
    SetGUIThread(Platform::GetCurrentThreadID());
    m_IsReady.Signal();
    while (!m_MustEnd) {
        m_Queue.Wait(Platform::kNoTimeLimit);
        while (auto* call = static_cast<Call*>(m_Queue.Get())) {
            call->m_Result = call->m_Function(call->m_A, call->m_B);
            call->Reply();
        }
    }
}

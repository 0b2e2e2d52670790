#pragma once

#include <thread>

#include "Platform/Event.h"
#include "Platform/EventQueue.h"

// The thread that the application's objects belong to. Members without SSF_AnyThread run here, one
// after the other, so objects need no locks of their own. An application with windows does the same
// with the event loop that it has.
class UIThread {
public:
    UIThread();   // returns when it is the UI thread
    ~UIThread();  // does what is queued, then ends the thread

    // For ScriptConfig::UIExecute: function(a, b) on this thread, from any thread.
    using Function = unsigned long long (*)(void* a, void* b);
    unsigned long long Execute(Function function, void* a, void* b, bool wait);

private:
    void Run();

    Korvel::KorvelScript::EventQueue m_Queue;
    Korvel::KorvelScript::Event m_IsReady;
    bool m_MustEnd = false;
    std::thread m_Thread;
};

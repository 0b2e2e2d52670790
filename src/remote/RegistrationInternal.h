#pragma once

#include <atomic>

#include "Platform/Event.h"
#include "Platform/Lock.h"
#include "core/RefObject.h"
#include "core/ScriptVal.h"

namespace Korvel {

namespace Platform {
struct _Thread;
}

class ServerApp;

// Keeps a host known to the script server of its machine, on a thread of its own: it connects,
// starts a server where none answers, and does so again some time after the connection has ended.
//
// Lifetime: Use and Recycle. The thread and the connection hold a use.
class Registration : public RefCount {
public:
    // `info` is what the server is told. It starts servers only if it may. `whenTried` is called on
    // the thread, once the first attempt is over: after ten seconds at the latest, some seconds
    // more where a server takes the call and does not answer.
    Registration(const ScriptVal& info, bool mayStart, void (*whenTried)());
    ~Registration() override;

    bool Start();  // false when there is no thread

    // Has the thread end, whatever it waits for, and the connection, and waits for that. False when
    // it takes more than ten seconds.
    bool Stop();

private:
    friend class ServerApp;

    void Run();
    bool Register();
    bool Connect(double timeOut);
    bool Introduce(double timeOut);
    void SetApp(ptr<ServerApp> app);
    void EndConnection();
    void Cancel();
    bool Pause(int64_t milliseconds);

    // Fixed after construction
    const ScriptVal m_Info;
    const bool m_MayStart;
    void (*const m_WhenTried)();

    Platform::_Thread* m_Thread = nullptr;  // of the host's thread
    std::atomic<bool> m_MustStop{false};
    KorvelScript::Event m_News;  // it must stop, or the connection has ended

    KorvelScript::Lock m_Lock;
    // The connection, if there is one; written by the thread alone, guarded by m_Lock
    ptr<ServerApp> m_App;
};

}  // namespace Korvel

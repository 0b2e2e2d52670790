#include "Platform/Thread.h"

#include <utility>

#include "Platform/NoKillInternal.h"
#include "Platform/Threads.h"
#include "core/SpinLock.h"

namespace Korvel::KorvelScript {
namespace {

constexpr unsigned int kQuitLimitMs = 10000;

}  // namespace

// What the object and its running body share. Each of them holds it, so that either may go first.
//
// The handle belongs to whoever takes it out of the record: the body when it ends, the destructor,
// or KillThread. He drops the creator's reference.
struct Thread::Record : Reuser {
    // Holds the lock, and keeps kills away meanwhile.
    class Guard {
    public:
        explicit Guard(Record* record) : m_Lock(record->m_Lock) {}

    private:
        Platform::NoKill m_NoKill;
        AutoSpinLock m_Lock;
    };

    explicit Record(Thread* object) : m_Object(object) {}

    void Hold() { m_Holders++; }
    void Drop() {
        if (--m_Holders == 0) delete this;
    }

    Platform::_Thread* TakeThread(unsigned& run) {
        Guard guard(this);
        run = m_Run;
        return std::exchange(m_Thread, nullptr);
    }

    // For the body of a run that is gone or goes at once, unless it has done so itself; the next
    // one may have begun since.
    void EndBody(unsigned run) {
        Platform::NoKill noKill;
        {
            Guard guard(this);
            if (run != m_Run || !m_HasBody) return;
            m_HasBody = false;
            m_ID = 0;
        }
        Drop();
    }

    std::atomic<int> m_Holders{1};
    SpinLock m_Lock;

    // Guarded by m_Lock
    Thread* m_Object;        // null once it is being destroyed
    unsigned m_Run = 0;      // raised by each start
    bool m_HasBody = false;  // of this run; it then holds the record
    bool m_DeleteOnQuit = false;
    Platform::_Thread* m_Thread = nullptr;
    unsigned long long m_ID = 0;
};

Thread::Thread() : m_Record(new Record(this)) {}

Thread::~Thread() {
    if (!m_Record) return;
    Platform::_Thread* thread;
    unsigned run;
    {
        Record::Guard guard(m_Record);
        m_Record->m_Object = nullptr;
        thread = std::exchange(m_Record->m_Thread, nullptr);
        run = m_Record->m_Run;
    }
    // A body that destroys its own object goes on to its end.
    if (thread && thread != Platform::GetCurrentThread()) {
        bool isGone = Platform::WaitThread(thread, kQuitLimitMs) || Platform::KillThread(thread, 0);
        if (isGone) m_Record->EndBody(run);
    }
    Platform::DeleteThread(thread);
    m_Record->Drop();
}

// The table of virtual operations is read here while a destructor may be writing its own there:
// either has a Main to call.
__attribute__((no_sanitize("thread"))) unsigned long long Thread::RunMain(Thread* self) {
    return static_cast<unsigned int>(self->Main());
}

unsigned long long Thread::threadFunc(void* argument) {
    Record* record = static_cast<Record*>(argument);
    Thread* self;
    unsigned run;
    {
        Record::Guard guard(record);
        self = record->m_Object;
        run = record->m_Run;
    }
    unsigned long long result = self ? RunMain(self) : 0;
    Platform::_Thread* thread;
    {
        Platform::NoKill noKill;
        {
            Record::Guard guard(record);
            self = record->m_DeleteOnQuit ? record->m_Object : nullptr;
            thread = std::exchange(record->m_Thread, nullptr);
        }
        record->EndBody(run);
    }
    delete self;
    Platform::DeleteThread(thread);
    return result;
}

Platform::_Thread* Thread::Start() {
    if (!m_Record) return nullptr;
    Platform::NoKill noKill;
    unsigned run;
    {
        Record::Guard guard(m_Record);
        if (std::exchange(m_Record->m_HasBody, true)) return nullptr;
        run = ++m_Record->m_Run;
        m_Record->Hold();
    }
    unsigned long long id;
    Platform::_Thread* thread =
        Platform::NewThread(threadFunc, m_Record, Platform::kThreadSuspended, &id);
    if (!thread) {
        m_Record->EndBody(run);
        return nullptr;
    }
    // The body waits for the lock, and behind it the object may be gone.
    Record::Guard guard(m_Record);
    m_Record->m_Thread = thread;
    m_Record->m_ID = id;
    Platform::ResumeThread(thread);
    return thread;
}

bool Thread::Suspend() {
    if (!m_Record) return true;
    Record::Guard guard(m_Record);
    return !m_Record->m_Thread || Platform::SuspendThread(m_Record->m_Thread);
}

bool Thread::Resume() {
    if (!m_Record) return true;
    Record::Guard guard(m_Record);
    return !m_Record->m_Thread || Platform::ResumeThread(m_Record->m_Thread);
}

bool Thread::IsRunning() const {
    if (!m_Record) return false;
    Record::Guard guard(m_Record);
    return m_Record->m_ID != 0;
}

Platform::_Thread* Thread::GetThread() const {
    if (!m_Record) return nullptr;
    Record::Guard guard(m_Record);
    return m_Record->m_Thread;
}

bool Thread::KillThread() {
    unsigned run = 0;
    Platform::_Thread* thread = m_Record ? m_Record->TakeThread(run) : nullptr;
    if (!thread) return false;
    Record* record = m_Record;
    if (thread == Platform::GetCurrentThread()) {
        record->EndBody(run);
        Platform::DeleteThread(thread);  // the body's reference is left
        return Platform::KillThread(thread, 0);
    }
    record->Hold();
    bool isGone = Platform::KillThread(thread, 0);
    if (isGone) {
        record->EndBody(run);
    } else {
        // It goes on, or has ended meanwhile, and then perhaps the object as well.
        Record::Guard guard(record);
        if (record->m_HasBody && record->m_Run == run) {
            record->m_Thread = std::exchange(thread, nullptr);
        }
    }
    Platform::DeleteThread(thread);
    record->Drop();
    return isGone;
}

void Thread::SetDeleteOnQuit(bool deleteOnQuit) {
    if (!m_Record) return;
    Record::Guard guard(m_Record);
    m_Record->m_DeleteOnQuit = deleteOnQuit;
}

}  // namespace Korvel::KorvelScript

#pragma once

#include <pthread.h>

#include <atomic>
#include <cstdint>
#include <mutex>

#include "Platform/Events.h"
#include "Platform/FutexInternal.h"
#include "Platform/NoKillInternal.h"
#include "Platform/Threads.h"
#include "core/0ReusePool.h"

namespace Korvel {
struct Magazine;
}

namespace Korvel::Platform {

enum class ThreadKind : uint8_t {
    Bare,     // no thread behind it: a record of CreateThreadStruct alone
    Made,     // by NewThread
    Adopted,  // somebody else's thread; it can neither be killed nor detached
};

// Who ends a body, and with that who drops the body's reference.
enum class ThreadFate : uint8_t {
    Running,
    KillAsked,  // KillThread is signalling; the handler may end the thread
    Killed,     // by the handler: the reference is for KillThread to drop, after its join
    Ended,      // the reference is spoken for: dropped, or about to be, by whoever wrote this
};

struct _Thread : Reuser {
    std::atomic<uint32_t> m_RefCount{1};
    pthread_t m_OSThread{};
    unsigned long long m_ID = 0;
    _Event* m_QuitEvent = nullptr;
    ThreadEntry m_Entry = nullptr;
    void* m_Argument = nullptr;

    // Fixed before the gate has left its first state
    ThreadKind m_Kind = ThreadKind::Bare;
    Magazine* m_Magazine = nullptr;  // what a killed thread cannot give back itself

    FutexWord m_Gate{0};
    std::atomic<ThreadFate> m_Fate{ThreadFate::Running};

    // The futex words, at most two, one of which the thread sleeps on where a kill may end it.
    std::atomic<const void*> m_SleepsOn[2]{};

    std::atomic<bool> m_HasSignal{false};  // a kill signal is on its way to the thread

    // Held, under NoKill, by whoever joins the thread or uses m_OSThread: after the join there must
    // be no call on that handle any more. Whoever joins says so, for he may hold it for a while.
    std::mutex m_JoinMutex;
    std::atomic<bool> m_IsBeingJoined{false};  // written under m_JoinMutex
    std::atomic<bool> m_IsJoined{false};       // written under m_JoinMutex
};

// Adds a reference, for somebody who has one or is told by one who has. DeleteThread drops it.
inline void HoldThread(_Thread* thread) {
    thread->m_RefCount.fetch_add(1, std::memory_order_relaxed);
}

// The calling thread's record; null as long as a thread that is not ours has not been adopted.
extern constinit thread_local _Thread* t_ThisThread __attribute__((tls_model("initial-exec")));

// Lets the current thread be killed while it sleeps on a futex word, inside of its caller's one
// NoKill guard; the second word is one that the sleeper may be moved to. Whoever kills it wakes
// another sleeper in its place: the dead thread may have been chosen for a wake-up that it did not
// live to act on.
class KillableSleep {
public:
    explicit KillableSleep(const void* word, const void* otherWord = nullptr) {
        Note(word, otherWord);
        AddNoKillDepth(-1);
    }
    KillableSleep(const KillableSleep&) = delete;
    KillableSleep& operator=(const KillableSleep&) = delete;
    ~KillableSleep() {
        AddNoKillDepth(1);
        Note(nullptr, nullptr);
    }

private:
    static void Note(const void* word, const void* otherWord) {
        if (!t_ThisThread) return;
        t_ThisThread->m_SleepsOn[0].store(word, std::memory_order_relaxed);
        t_ThisThread->m_SleepsOn[1].store(otherWord, std::memory_order_relaxed);
    }
};

}  // namespace Korvel::Platform

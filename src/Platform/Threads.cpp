// Threads, and how they end.
//
// A body ends in one of three ways, and m_Fate says which. It returns: the wrapper, which cannot be
// killed from there on, writes Ended. It kills itself: the same, but the thread leaves by the raw
// system call. Or another thread kills it: KillThread writes KillAsked and signals; the handler
// turns that into Killed and leaves; KillThread, which alone may join meanwhile, does the rest. A
// kill that gives up takes its KillAsked back, and when it cannot, the handler has been faster.
#include "Platform/Threads.h"

#include <sched.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <bit>
#include <climits>
#include <cmath>
#include <cstdio>
#include <cstring>

#include "Platform/Events.h"
#include "Platform/LocaleInternal.h"
#include "Platform/Platform.h"
#include "Platform/ThreadInternal.h"
#include "Platform/Time.h"
#include "Platform/TimeInternal.h"
#include "core/ReusePoolInternal.h"
#include "core/SpinLock.h"

#if defined(__x86_64__) || defined(__i386__)
#include <xmmintrin.h>
#endif

namespace Korvel::Platform {

constinit thread_local _Thread* t_ThisThread = nullptr;

namespace {

// States of a record's gate
constexpr uint32_t kGateStarting = 0;  // NewThread waits for the id
constexpr uint32_t kGateHeld = 1;      // the body waits for ResumeThread
constexpr uint32_t kGateOpen = 2;

constexpr uint64_t kKillStepNs = kMillisecondNs;  // from one signal to the next
constexpr uint64_t kKillLimitNs = kSecondNs;

constexpr size_t kMaxNameBytes = 15;  // the system's limit

constinit thread_local unsigned long long t_ThisThreadID
    __attribute__((tls_model("initial-exec"))) = 0;

constinit std::atomic<int> s_KillSignal{0};             // 0: the default
constinit std::atomic<bool> s_IsKillSignalUsed{false};  // threads rely on its number

int KillSignal() {
    int number = s_KillSignal.load(std::memory_order_relaxed);
    return number ? number : SIGRTMIN + 6;
}

unsigned long long AskForID() {
    return static_cast<unsigned long long>(gettid());
}

void DropReference(_Thread* thread) {
    if (thread->m_RefCount.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
    if (thread->m_Kind == ThreadKind::Made && !thread->m_IsJoined) {
        pthread_detach(thread->m_OSThread);
    }
    DeleteEvent(thread->m_QuitEvent);
    delete thread;
}

// Drops an adopted thread's record when the thread ends. The id stays, for destructors to come.
struct AdoptedThread {
    AdoptedThread() = default;
    AdoptedThread(const AdoptedThread&) = delete;
    AdoptedThread& operator=(const AdoptedThread&) = delete;
    ~AdoptedThread() {
        NoKill noKill;
        t_ThisThread = nullptr;
        if (m_Record) DropReference(m_Record);
    }

    _Thread* m_Record = nullptr;
};

thread_local AdoptedThread t_Adopted;

void RefreshIDAfterFork() {
    if (!t_ThisThreadID) return;
    t_ThisThreadID = AskForID();
    if (!t_ThisThread) return;
    t_ThisThread->m_ID = t_ThisThreadID;
    // Who kills the parent's thread is not here, and neither is his signal.
    t_ThisThread->m_Fate = ThreadFate::Running;
    t_ThisThread->m_HasSignal = false;
}

[[maybe_unused]] const int s_ForkHook = pthread_atfork(nullptr, nullptr, RefreshIDAfterFork);

// The end of a body in its own thread, which cannot be killed any more.
void EndBody(_Thread* self) {
    self->m_Fate.store(ThreadFate::Ended);
    t_ThisThread = nullptr;
    SetEvent(self->m_QuitEvent);
    DropReference(self);
}

// The end of a thread as far as the system is concerned: it can be joined, and nothing has run.
// Only what the C library would hand on to the next thread on the same stack is cleared.
[[noreturn]] void LeaveThread() {
    for (pthread_key_t key = 0; key < PTHREAD_KEYS_MAX; key++) pthread_setspecific(key, nullptr);
    for (;;) syscall(SYS_exit, 0);
}

void OnKillSignal(int) {
    if (!t_ThisThread) return;
    t_ThisThread->m_HasSignal = false;
    t_IsKillDue = true;
    if (t_NoKillDepth == 0) TakeDueKill();
}

// Puts our handler on the kill signal, unless somebody else uses it.
bool InstallKillHandler() {
    struct sigaction action;
    if (sigaction(KillSignal(), nullptr, &action) != 0) return false;
    if (action.sa_flags & SA_SIGINFO) return false;
    if (action.sa_handler == OnKillSignal) return true;
    if (action.sa_handler != SIG_DFL) return false;
    action = {};
    action.sa_handler = OnKillSignal;
    action.sa_flags = SA_RESTART;
    sigfillset(&action.sa_mask);
    return sigaction(KillSignal(), &action, nullptr) == 0;
}

void UnblockKillSignal() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, KillSignal());
    pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
}

// Holds m_JoinMutex for a join.
class Joining {
public:
    explicit Joining(_Thread& thread) : m_Thread(thread), m_Lock(thread.m_JoinMutex) {
        m_Thread.m_IsBeingJoined = true;
    }
    ~Joining() { m_Thread.m_IsBeingJoined = false; }

private:
    _Thread& m_Thread;
    std::lock_guard<std::mutex> m_Lock;
};

// Holds m_JoinMutex for a call on m_OSThread, unless the thread has been joined or somebody is at
// it: it may take the thread's exit handlers, and those may ask for the same.
std::unique_lock<std::mutex> LockOSThread(_Thread& thread) {
    std::unique_lock lock(thread.m_JoinMutex, std::defer_lock);
    SpinWait wait;
    while (!thread.m_IsBeingJoined && !lock.try_lock()) wait.Step();
    if (lock && (thread.m_IsJoined || thread.m_Kind == ThreadKind::Bare)) lock.unlock();
    return lock;
}

void JoinLocked(_Thread& thread) {
    if (!thread.m_IsJoined && pthread_join(thread.m_OSThread, nullptr) == 0) {
        thread.m_IsJoined = true;
    }
}

bool JoinForAMomentLocked(_Thread& thread) {
    timespec until = ToTimespec(ReadClock(CLOCK_MONOTONIC) + kKillStepNs);
    if (pthread_clockjoin_np(thread.m_OSThread, nullptr, CLOCK_MONOTONIC, &until) != 0)
        return false;
    thread.m_IsJoined = true;
    return true;
}

// Sees to it that another thread is gone and joined. False when it cannot be killed.
bool EndAndJoinLocked(_Thread& thread) {
    ThreadFate expected = ThreadFate::Running;
    if (thread.m_Fate == expected && !InstallKillHandler()) return false;
    if (!thread.m_Fate.compare_exchange_strong(expected, ThreadFate::KillAsked)) {
        JoinLocked(thread);  // the body has ended by itself
        return true;
    }
    uint64_t limit = ReadClock(CLOCK_MONOTONIC) + kKillLimitNs;
    do {
        // One at a time: signals that a thread does not take would fill the system's queue.
        if (!thread.m_HasSignal.exchange(true)) pthread_kill(thread.m_OSThread, KillSignal());
        if (JoinForAMomentLocked(thread)) return true;
    } while (ReadClock(CLOCK_MONOTONIC) < limit);

    expected = ThreadFate::KillAsked;
    if (thread.m_Fate.compare_exchange_strong(expected, ThreadFate::Running)) return false;
    JoinLocked(thread);
    return true;
}

[[noreturn]] void KillSelf(_Thread* self) {
    AddNoKillDepth(1);
    Magazine* magazine = self->m_Magazine;
    EndBody(self);
    if (magazine) AbandonMagazine(magazine);
    LeaveThread();
}

// What a policy makes of the scale. False for a policy with one priority only.
bool GetPriorityLimits(int policy, int& lowest, int& highest) {
    lowest = sched_get_priority_min(policy);
    highest = sched_get_priority_max(policy);
    return lowest < highest;
}

void SetPriority(pthread_t thread, ThreadPri priority) {
    int policy;
    sched_param param;
    int lowest, highest;
    if (pthread_getschedparam(thread, &policy, &param) != 0) return;
    if (!GetPriorityLimits(policy, lowest, highest)) return;
    float step = static_cast<float>(priority) * static_cast<float>(highest - lowest) / 6;
    param.sched_priority = static_cast<int>(static_cast<float>(lowest) + step);
    pthread_setschedparam(thread, policy, &param);
}

// What NewThread hands to its wrapper. It lives on NewThread's stack until the gate has left its
// first state.
struct Launch {
    _Thread* m_Thread;
    unsigned long long* m_IDOut;
    bool m_IsSuspended;
};

void WaitForGate(_Thread* self) {
    for (;;) {
        uint32_t state = self->m_Gate.load(std::memory_order_acquire);
        if (state == kGateOpen) return;
        FutexWait(self->m_Gate, state);
    }
}

// Ends the body when the wrapper is left, also by pthread_exit. The guard against kills stays up
// for the rest of the thread: its exit handlers give back the magazine.
struct BodyEnd {
    _Thread* m_Thread;
    ~BodyEnd() {
        AddNoKillDepth(1);
        EndBody(m_Thread);
    }
};

void* s_threadfunc(void* argument) {
    _Thread* self;
    {
        NoKill noKill;
        Launch launch = *static_cast<Launch*>(argument);
        self = launch.m_Thread;
        t_ThisThread = self;
        t_ThisThreadID = AskForID();
        self->m_OSThread = pthread_self();
        self->m_ID = t_ThisThreadID;
        self->m_Magazine = ObtainMagazine();
        if (launch.m_IDOut) *launch.m_IDOut = t_ThisThreadID;
        UnblockKillSignal();
        InitThread();
        SetPriority(self->m_OSThread, kDefaultThreadPri);
        self->m_Gate.store(launch.m_IsSuspended ? kGateHeld : kGateOpen, std::memory_order_release);
        FutexWake(&self->m_Gate, INT_MAX);
    }
    WaitForGate(self);
    BodyEnd end{self};
    return std::bit_cast<void*>(self->m_Entry(self->m_Argument));
}

#if defined(__x86_64__) || defined(__i386__)
constexpr unsigned int kFlushToZero = 0x8000;
constexpr unsigned int kDenormalsAreZero = 0x40;

void SetFloatState() {
    static const unsigned int s_csrflags =
        kFlushToZero | (Ox_IsDAZProcessor() ? kDenormalsAreZero : 0);
    _mm_setcsr(_mm_getcsr() | s_csrflags);
}
#else
void SetFloatState() {}
#endif

}  // namespace

void TakeDueKill() {
    t_IsKillDue = false;
    ThreadFate expected = ThreadFate::KillAsked;
    if (t_ThisThread && t_ThisThread->m_Fate.compare_exchange_strong(expected, ThreadFate::Killed))
        LeaveThread();
}

_Thread* CreateThreadStruct(bool withEvent) {
    NoKill noKill;
    _Thread* thread = new _Thread;
    if (!thread || !withEvent) return thread;
    thread->m_RefCount = 2;
    thread->m_QuitEvent = NewEvent(true, false);
    if (thread->m_QuitEvent) return thread;
    delete thread;
    return nullptr;
}

_Thread* NewThread(ThreadEntry entry, void* argument, unsigned int flags,
                   unsigned long long* idOut) {
    NoKill noKill;
    _Thread* thread = CreateThreadStruct(true);
    if (!thread) return nullptr;
    s_IsKillSignalUsed = true;
    thread->m_Kind = ThreadKind::Made;
    thread->m_Entry = entry;
    thread->m_Argument = argument;

    Launch launch{thread, idOut, (flags & kThreadSuspended) != 0};
    pthread_t osThread;
    if (pthread_create(&osThread, nullptr, s_threadfunc, &launch) != 0) {
        DeleteEvent(thread->m_QuitEvent);
        delete thread;
        return nullptr;
    }
    while (thread->m_Gate.load(std::memory_order_acquire) == kGateStarting) {
        FutexWait(thread->m_Gate, kGateStarting);
    }
    return thread;
}

void DeleteThread(_Thread* thread) {
    NoKill noKill;
    if (thread) DropReference(thread);
}

bool ResumeThread(_Thread* thread) {
    uint32_t held = kGateHeld;
    if (thread->m_Gate.compare_exchange_strong(held, kGateOpen, std::memory_order_release)) {
        FutexWake(&thread->m_Gate, INT_MAX);
    }
    return true;
}

bool SuspendThread(_Thread*) {
    return true;
}

bool WaitThread(_Thread* thread, unsigned int timeoutMs) {
    if (thread->m_IsJoined) return true;
    // Where the body ends it may drop all references but this one.
    HoldThread(thread);
    bool hasEnded = !thread->m_QuitEvent || WaitEvent(thread->m_QuitEvent, timeoutMs);
    if (hasEnded && thread->m_Kind == ThreadKind::Adopted) {
        // It may go on for ever, so this is no place for the guard or the mutex. What the host does
        // with its own thread is not ours to note.
        pthread_join(thread->m_OSThread, nullptr);
    } else if (hasEnded && thread->m_Kind == ThreadKind::Made) {
        NoKill noKill;
        Joining joining(*thread);
        JoinLocked(*thread);
    }
    DeleteThread(thread);
    return hasEnded;
}

bool HasThreadQuit(_Thread* thread) {
    if (thread->m_IsJoined || thread->m_Kind == ThreadKind::Bare) return true;
    if (thread->m_Kind == ThreadKind::Adopted) {
        return tgkill(getpid(), static_cast<pid_t>(thread->m_ID), 0) != 0;
    }
    NoKill noKill;
    std::unique_lock lock = LockOSThread(*thread);
    if (lock && pthread_tryjoin_np(thread->m_OSThread, nullptr) == 0) thread->m_IsJoined = true;
    return thread->m_IsJoined;
}

bool WaitAllThreads(unsigned int count, _Thread** threads, unsigned int timeoutMs) {
    if (timeoutMs == kNoTimeLimit) {
        for (unsigned int i = 0; i < count; i++) WaitThread(threads[i], kNoTimeLimit);
        return true;
    }
    unsigned long long deadline = GetUpTime() + timeoutMs;
    while (GetUpTime() < deadline) {
        unsigned int gone = 0;
        while (gone < count && HasThreadQuit(threads[gone])) gone++;
        if (gone == count) return true;
        Wait(10);
    }
    return false;
}

bool KillThread(_Thread* thread, unsigned int) {
    if (!thread || thread->m_Kind != ThreadKind::Made) return false;
    if (thread == t_ThisThread) KillSelf(thread);

    NoKill noKill;
    bool isOurs;
    {
        Joining joining(*thread);
        if (!thread->m_IsJoined && !EndAndJoinLocked(*thread)) return false;
        isOurs = thread->m_Fate.exchange(ThreadFate::Ended) == ThreadFate::Killed;
        if (isOurs) {
            if (thread->m_Magazine) AbandonMagazine(thread->m_Magazine);
            for (const void* word : thread->m_SleepsOn) {
                if (word) FutexWake(word, 1);
            }
            SetEvent(thread->m_QuitEvent);
        }
    }
    if (isOurs) DropReference(thread);
    return true;
}

bool SetKillSignal(int signalNumber) {
    struct sigaction action;
    if (s_IsKillSignalUsed || signalNumber == SIGKILL || signalNumber == SIGSTOP ||
        sigaction(signalNumber, nullptr, &action) != 0) {
        return false;
    }
    s_KillSignal = signalNumber;
    return true;
}

unsigned long long GetThreadID(_Thread* thread) {
    return thread->m_ID;
}

unsigned long long GetCurrentThreadID() {
    if (!t_ThisThreadID) _SetCurrentThread();
    return t_ThisThreadID;
}

_Thread* GetCurrentThread() {
    if (!t_ThisThreadID) _SetCurrentThread();
    return t_ThisThread;
}

void _SetCurrentThread() {
    if (t_ThisThread) return;
    t_ThisThreadID = AskForID();
    NoKill noKill;
    _Thread* thread = CreateThreadStruct(false);
    if (!thread) return;
    thread->m_Kind = ThreadKind::Adopted;
    thread->m_OSThread = pthread_self();
    thread->m_ID = t_ThisThreadID;
    t_Adopted.m_Record = thread;
    t_ThisThread = thread;
}

locale_t CLocale() {
    NoKill noKill;
    // The C library keeps this one ready, so it takes no memory and cannot fail.
    static const locale_t s_CLocale = newlocale(LC_ALL_MASK, "C", nullptr);
    return s_CLocale;
}

void InitThread() {
    SetFloatState();
    // setlocale would change the whole process.
    uselocale(CLocale());
}

void SetThreadPriority(_Thread* thread, ThreadPri priority) {
    if (priority > 6) return;
    NoKill noKill;
    if (std::unique_lock lock = LockOSThread(*thread)) SetPriority(thread->m_OSThread, priority);
}

ThreadPri GetThreadPriority(_Thread* thread) {
    NoKill noKill;
    std::unique_lock lock = LockOSThread(*thread);
    int policy;
    sched_param param;
    int lowest, highest;
    if (!lock || pthread_getschedparam(thread->m_OSThread, &policy, &param) != 0 ||
        !GetPriorityLimits(policy, lowest, highest)) {
        return kDefaultThreadPri;
    }
    float part =
        static_cast<float>(param.sched_priority - lowest) / static_cast<float>(highest - lowest);
    return static_cast<ThreadPri>(std::lround(part * 6));
}

void SetThreadName(const char* name, _Thread*) {
    if (!name) return;
    char buffer[kMaxNameBytes + 1];
    size_t length = strnlen(name, kMaxNameBytes + 1);
    if (length > kMaxNameBytes) {
        length = kMaxNameBytes;
        while (length && (name[length] & 0xC0) == 0x80) length--;  // a character stays whole
    }
    memcpy(buffer, name, length);
    buffer[length] = 0;
    NoKill noKill;
    pthread_setname_np(pthread_self(), buffer);
}

unsigned int GetIdealThreadCount() {
    long count = sysconf(_SC_NPROCESSORS_ONLN);
    if (count > 0) return static_cast<unsigned int>(count);
    NoKill noKill;
    perror("sysctl");
    return 1;
}

void SetThreadIdealProcessor(_Thread*, unsigned int) {}
unsigned int GetThreadIdealProcessor(_Thread*) {
    return 0;
}
unsigned int GetThreadExitCode(_Thread*) {
    return 0;
}

}  // namespace Korvel::Platform

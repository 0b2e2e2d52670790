// Threads that are ended in the middle of things. This is a program of its own, for it runs without
// the search for leaks: what a killed thread owned is lost, and that is how it should be.
#include <gtest/gtest.h>
#include <pthread.h>
#include <sched.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <fstream>
#include <functional>
#include <lua.hpp>
#include <random>
#include <string>
#include <thread>

#include "Platform/EventQueue.h"
#include "Platform/Events.h"
#include "Platform/Mutex.h"
#include "Platform/NoKillInternal.h"
#include "Platform/Processes.h"
#include "Platform/Threads.h"
#include "Platform/Time.h"
#include "Support.h"
#include "core/0ReusePool.h"
#include "diag/Debug.h"

extern "C" KORVEL_EXPORT const char* __asan_default_options();
extern "C" const char* __asan_default_options() {
    return "detect_leaks=0";
}

namespace Korvel::Platform {
namespace {

using KorvelScript::QueueNode;

constexpr unsigned kLong = 20000;  // only ever reached by a failure

template <class Condition>
bool Eventually(Condition condition) {
    unsigned long long limit = GetTimeCount() + kLong / 1000 * GetTimeFreq();
    while (!condition() && GetTimeCount() < limit) std::this_thread::yield();
    return GetTimeCount() < limit;
}

KorvelScript::Event s_IsAtWork;

void LoopForEver() {
    for (std::atomic<unsigned> i{0};; i++) continue;
}

// The system takes a thread off its books a moment after the join has seen it end.
bool IsGone(unsigned long long id) {
    return Eventually(
        [&] { return syscall(SYS_tgkill, getpid(), static_cast<pid_t>(id), 0) != 0; });
}

// A kill and what it must leave behind.
void ExpectKilled(_Thread* thread) {
    unsigned long long id = GetThreadID(thread);
    EXPECT_TRUE(KillThread(thread, 1));
    EXPECT_TRUE(IsGone(id));
    EXPECT_TRUE(HasThreadQuit(thread) && WaitThread(thread, 0) && KillThread(thread, 1));
    DeleteThread(thread);
}

using Body = std::function<void()>;

_Thread* Start(Body& body, unsigned flags = 0) {
    auto call = [](void* function) {
        (*static_cast<Body*>(function))();
        return 0ull;
    };
    return NewThread(call, &body, flags, nullptr);
}

// For a body that signals when it is at work.
_Thread* StartAtWork(Body& body) {
    _Thread* thread = Start(body);
    EXPECT_TRUE(s_IsAtWork.Wait(kLong));
    return thread;
}

Body s_Loop = [] {
    s_IsAtWork.Signal();
    LoopForEver();
};

// Nothing is unwound, and what the dead thread kept under its keys does not turn up in the next
// thread on the same stack.
TEST(Kill, EndlessLoop) {
    static std::atomic<int> trouble{0};
    pthread_key_t key;
    ASSERT_EQ(pthread_key_create(&key, [](void*) { trouble++; }), 0);
    Body body = [&] {
        struct Unwinding {
            ~Unwinding() { trouble++; }
        } unwinding;
        pthread_setspecific(key, &key);
        s_Loop();
    };
    for (int i = 0; i < 50; i++) {
        ExpectKilled(StartAtWork(body));
        std::thread([&] { trouble += pthread_getspecific(key) != nullptr; }).join();
    }
    EXPECT_EQ(trouble, 0);
    pthread_key_delete(key);
}

TEST(Kill, EndlessCompiledLua) {
    Body body = [] {
        lua_State* L = luaL_newstate();
        luaL_openlibs(L);
        lua_register(L, "tell", [](lua_State*) {
            s_IsAtWork.Signal();
            return 0;
        });
        // It tells when its own loop has been compiled, so from there on it runs machine code
        // alone.
        const char* script =
            "jit.attach(function(what) if what == 'stop' then jit.attach(tell) tell() end end, "
            "'trace')\n"
            "local i = 0\n"
            "while true do i = i + 1 end";
        if (luaL_dostring(L, script)) ADD_FAILURE() << lua_tostring(L, -1);
    };
    for (int i = 0; i < 5; i++) ExpectKilled(StartAtWork(body));
}

TEST(Kill, NotYetStarted) {
    std::atomic<bool> hasRun{false};
    Body body = [&] { hasRun = true; };
    ExpectKilled(Start(body, kThreadSuspended));
    EXPECT_FALSE(hasRun);
}

bool WaitUntilAsleep(_Thread* thread) {
    return Eventually([&] {
        Wait(1);
        std::ifstream file("/proc/self/task/" + std::to_string(GetThreadID(thread)) + "/stat");
        std::string text;
        std::getline(file, text);
        return text.find(") S ") != std::string::npos;
    });
}

// All on one processor, where a thread of the idle policy does not run before the test itself
// sleeps: so the victim is killed between the signal that is meant for it and its waking up.
TEST(Kill, WaiterLeavesEventAndMutexWhole) {
    cpu_set_t before, one;
    sched_getaffinity(0, sizeof before, &before);
    CPU_ZERO(&one);
    CPU_SET(sched_getcpu(), &one);
    sched_setaffinity(0, sizeof one, &one);
    enum { KilledFirst, SignalledFirst, OnMutex, kKinds };
    for (int i = 0; i < 60; i++) {
        int kind = i % kKinds;
        _Event* event = NewEvent(false, false);
        _Mutex* mutex = NewMutex(true);
        std::atomic<int> started{0}, taken{0};
        Body body = [&] {
            sched_param param{};
            if (started++ == 0) pthread_setschedparam(pthread_self(), SCHED_IDLE, &param);
            s_IsAtWork.Signal();
            if (kind == OnMutex) {
                ObtainMutex(mutex, kNoTimeLimit);
                ReleaseMutex(mutex);
            } else {
                taken += WaitEvent(event, kNoTimeLimit);
            }
        };
        _Thread* victim = StartAtWork(body);
        EXPECT_TRUE(WaitUntilAsleep(victim));  // it is the first in the queue
        _Thread* survivor = StartAtWork(body);
        EXPECT_TRUE(WaitUntilAsleep(survivor));
        if (kind == SignalledFirst) SetEvent(event);
        ExpectKilled(victim);
        // The signal was the victim's. It must not lie there while the other one sleeps.
        if (kind == SignalledFirst && !taken && !WaitThread(survivor, 2000)) {
            EXPECT_FALSE(WaitEvent(event, 0));
        }
        SetEvent(event);
        ReleaseMutex(mutex);
        EXPECT_TRUE(WaitThread(survivor, kLong));
        DeleteThread(survivor);
        DeleteEvent(event);
        EXPECT_TRUE(ObtainMutex(mutex, 0));
        ReleaseMutex(mutex);
        DeleteMutex(mutex);
    }
    sched_setaffinity(0, sizeof before, &before);
}

TEST(Kill, GivesBackTheThreadsFreeBlocks) {
    constexpr unsigned long kSize = 968;  // a class that nothing else here uses
    void* blocks[8];
    Body body = [&] {
        for (void*& block : blocks) block = g_ReusePoolMgr.Alloc(kSize);
        for (void* block : blocks) g_ReusePoolMgr.Free(block);
        s_Loop();
    };
    g_ReusePoolMgr.FreeAll();
    ExpectKilled(StartAtWork(body));
    void* block = g_ReusePoolMgr.Alloc(kSize);
    EXPECT_NE(std::find(blocks, blocks + 8, block), blocks + 8);
    g_ReusePoolMgr.Free(block);
}

// Threads that do nothing but use pools and queues, killed at any moment.
TEST(Kill, PoolsAndQueuesStayWhole) {
    KorvelScript::EventQueue queue;
    Body hammer = [&] {
        s_IsAtWork.Signal();
        std::mt19937 random(5);
        void* blocks[64] = {};
        for (;;) {
            for (void*& block : blocks) {
                g_ReusePoolMgr.Free(block);
                block = g_ReusePoolMgr.Alloc(random() % 1500);
            }
            for (unsigned i = 0; i < 8; i++) queue.Put(new QueueNode(i));
            if (QueueNode* node = queue.Get()) node->Reply();
        }
    };
    std::mt19937 random(11);
    unsigned taken = 0;
    for (int i = 0; i < 150; i++) {
        _Thread *first = StartAtWork(hammer), *second = StartAtWork(hammer);
        unsigned long long until = GetTimeCount() + random() % 2'000'000;
        while (GetTimeCount() < until) {
            if (QueueNode* node = queue.Get()) {
                EXPECT_LT(node->GetType(), 8u);
                node->Reply();
                taken++;
            } else {
                queue.Wait(1);
            }
        }
        ExpectKilled(first);
        ExpectKilled(second);
        while (QueueNode* node = queue.Get()) node->Reply();
    }
    EXPECT_GT(taken, 1000u);

    // Counts and lists agree: after giving everything back nothing is left, and what goes in
    // counts.
    g_ReusePoolMgr.FreeAll();
    EXPECT_EQ(g_ReusePoolMgr.GetSize(0), 0u);
    g_ReusePoolMgr.Free(g_ReusePoolMgr.Alloc(64));
    EXPECT_EQ(g_ReusePoolMgr.GetSize(0), 64u + 16u);
}

// A fork holds all locks of the pools, and a look at the environment that lock: neither may be left
// held. What is checked here does not fork, for the C library has locks of its own for that.
TEST(Kill, ForksAndTheEnvironmentLeaveNoLockHeld) {
    Body fork = [] {
        for (s_IsAtWork.Signal();;) {
            pid_t pid = ::fork();
            if (pid == 0) _exit(0);
            waitpid(pid, nullptr, 0);
        }
    };
    Body look = [] {
        OxStringT<char> value;
        for (s_IsAtWork.Signal();;) GetEnv("KorvelNoSuchVariable", value);
    };
    OxStringT<char> value;
    std::mt19937 random(7);
    for (int i = 0; i < 60; i++) {
        _Thread* threads[] = {StartAtWork(fork), StartAtWork(look), StartAtWork(look)};
        unsigned long long until = GetTimeCount() + random() % 2'000'000;
        while (GetTimeCount() < until) EXPECT_TRUE(GetEnv("PATH", value));
        for (_Thread* thread : threads) ExpectKilled(thread);
        g_ReusePoolMgr.FreeAll();
    }
    EXPECT_EQ(g_ReusePoolMgr.GetSize(1000), 0u);
}

// Two killers and a waiter, and of every other thread the body ends by itself at about that time.
TEST(Kill, RacesWithOthersAndWithTheEndOfTheBody) {
    std::atomic<int> ended{0};
    Body ends = [&] { ended++; };
    std::mt19937 random(3);
    for (int i = 0; i < 600; i++) {
        _Thread* thread = i % 2 ? Start(ends) : StartAtWork(s_Loop);
        unsigned long long until = GetTimeCount() + random() % 100'000;
        while (GetTimeCount() < until) continue;
        std::thread waiter([&] { EXPECT_TRUE(WaitThread(thread, kLong)); });
        std::thread killer([&] { EXPECT_TRUE(KillThread(thread, 0)); });
        EXPECT_TRUE(KillThread(thread, 0));
        EXPECT_TRUE(WaitThread(thread, 1));  // 0 may find the waiter at the event
        waiter.join();
        killer.join();
        ExpectKilled(thread);
    }
    EXPECT_GT(ended, 0);
}

TEST(Kill, Itself) {
    KorvelScript::Event go;
    std::atomic<bool> isPast{false};
    Body body = [&] {
        go.Wait(kLong);
        KillThread(GetCurrentThread(), 0);
        isPast = true;
    };
    for (int i = 0; i < 100; i++) {
        _Thread* thread = Start(body);
        unsigned long long id = GetThreadID(thread);
        if (i % 2) DeleteThread(thread);  // the body's reference is the last
        go.Signal();
        EXPECT_TRUE(i % 2 || WaitThread(thread, kLong));
        EXPECT_TRUE(IsGone(id));
        if (i % 2 == 0) DeleteThread(thread);
    }
    EXPECT_FALSE(isPast);
}

TEST(Kill, WaitsForTheEndOfAGuardAndGivesUp) {
    std::atomic<unsigned long long> guardEnd{GetTimeCount() + 100'000'000};
    std::atomic<bool> isGuardOver{false};
    Body body = [&] {
        {
            NoKill noKill;
            s_IsAtWork.Signal();
            while (GetTimeCount() < guardEnd) continue;
            isGuardOver = true;
        }
        LoopForEver();
    };
    ExpectKilled(StartAtWork(body));
    EXPECT_TRUE(isGuardOver);

    guardEnd = ~0ull;
    _Thread* thread = StartAtWork(body);
    EXPECT_FALSE(KillThread(thread, 0));
    EXPECT_FALSE(HasThreadQuit(thread));
    guardEnd = 0;
    EXPECT_FALSE(WaitThread(thread, 50));  // no signal is left over from the kill that gave up
    ExpectKilled(thread);
}

TEST(Kill, LeavesALogPrintable) {
    Korvel::Test::TempDir dir;
    DebugLog log(nullptr, dir.Path("log").c_str(), true);
    Body print = [&] {
        s_IsAtWork.Signal();
        for (;;) log.PrintF("x\n");
    };
    for (int i = 0; i < 50; i++) {
        ExpectKilled(StartAtWork(print));
        ASSERT_TRUE(log.TryObtainLock());
        log.ReleaseLock();
    }
}

TEST(Kill, SignalIsRefusedToStrangersAndIgnoredWithoutAKill) {
    ExpectKilled(StartAtWork(s_Loop));     // our handler is in place
    EXPECT_FALSE(SetKillSignal(SIGUSR2));  // too late
    _Thread* thread = StartAtWork(s_Loop);
    int number = SIGRTMIN + 6;
    struct sigaction ours = {}, strangers = {};
    strangers.sa_handler = [](int) {};
    sigaction(number, &strangers, &ours);
    EXPECT_FALSE(KillThread(thread, 0));
    EXPECT_FALSE(HasThreadQuit(thread));
    sigaction(number, &ours, nullptr);
    raise(number);
    for (int i = 0; i < 50; i++) {  // the first ones may find it inside of a guard
        syscall(SYS_tgkill, getpid(), static_cast<pid_t>(GetThreadID(thread)), number);
        EXPECT_FALSE(WaitThread(thread, 1) || HasThreadQuit(thread));
    }
    ExpectKilled(thread);
}

TEST(Kill, SignalCanBeMovedFirst) {
    auto moved = [] {
        if (SetKillSignal(SIGKILL) || SetKillSignal(0) || SetKillSignal(SIGRTMIN - 1)) _exit(2);
        if (!SetKillSignal(SIGUSR2)) _exit(3);
        signal(SIGRTMIN + 6, [](int) { _exit(4); });
        _exit(KillThread(StartAtWork(s_Loop), 0) ? 7 : 5);
    };
    testing::GTEST_FLAG(death_test_style) = "threadsafe";  // a process that has made no threads yet
    EXPECT_EXIT(moved(), testing::ExitedWithCode(7), "");
}

}  // namespace
}  // namespace Korvel::Platform

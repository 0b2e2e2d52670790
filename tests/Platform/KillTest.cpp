// Threads that are ended in the middle of things. This is a program of its own, for it runs without
// the search for leaks: what a killed thread owned is lost, and that is how it should be.
#include <gtest/gtest.h>
#include <pthread.h>
#include <sched.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <lua.hpp>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "Platform/EventQueue.h"
#include "Platform/Events.h"
#include "Platform/Lock.h"
#include "Platform/Mutex.h"
#include "Platform/NoKillInternal.h"
#include "Platform/Threads.h"
#include "Platform/Time.h"
#include "core/0ReusePool.h"

extern "C" KORVEL_EXPORT const char* __asan_default_options();
extern "C" const char* __asan_default_options() {
    return "detect_leaks=0";
}

namespace Korvel::Platform {
namespace {

using KorvelScript::EventQueue;
using KorvelScript::QueueNode;

constexpr unsigned kLong = 20000;  // only ever reached by a failure

// The system takes a thread off its books a moment after the join has seen it end.
bool IsGone(unsigned long long id) {
    unsigned long long limit = GetTimeCount() + kLong / 1000 * GetTimeFreq();
    while (syscall(SYS_tgkill, getpid(), static_cast<pid_t>(id), 0) == 0) {
        if (GetTimeCount() > limit) return false;
        std::this_thread::yield();
    }
    return true;
}

// A kill and what it must leave behind.
void ExpectKilled(_Thread* thread) {
    unsigned long long id = GetThreadID(thread);
    EXPECT_TRUE(KillThread(thread, 1));
    EXPECT_TRUE(IsGone(id));
    EXPECT_TRUE(HasThreadQuit(thread));
    EXPECT_TRUE(WaitThread(thread, 0));
    EXPECT_TRUE(KillThread(thread, 1));
    DeleteThread(thread);
}

// Starts a body that gets an event to tell that it is at work.
_Thread* Start(ThreadEntry entry, void* argument, _Event* isAtWork) {
    _Thread* thread = NewThread(entry, argument, 0, nullptr);
    EXPECT_NE(thread, nullptr);
    if (isAtWork) {
        EXPECT_TRUE(WaitEvent(isAtWork, kLong));
    }
    return thread;
}

struct EventHolder {
    _Event* m_Event = NewEvent(false, false);
    ~EventHolder() { DeleteEvent(m_Event); }
};

std::atomic<bool> s_HasUnwound{false};

unsigned long long LoopForEver(void* isAtWork) {
    struct Unwinding {
        ~Unwinding() { s_HasUnwound = true; }
    } unwinding;
    SetEvent(static_cast<_Event*>(isAtWork));
    for (std::atomic<unsigned> i{0};; i++) {
    }
}

TEST(Kill, EndlessLoop) {
    EventHolder isAtWork;
    for (int i = 0; i < 50; i++) {
        ExpectKilled(Start(LoopForEver, isAtWork.m_Event, isAtWork.m_Event));
    }
    EXPECT_FALSE(s_HasUnwound);
}

unsigned long long RunEndlessLua(void* isAtWork) {
    lua_State* L = luaL_newstate();
    luaL_openlibs(L);
    lua_pushlightuserdata(L, isAtWork);
    lua_pushcclosure(
        L,
        [](lua_State* l) {
            SetEvent(static_cast<_Event*>(lua_touserdata(l, lua_upvalueindex(1))));
            return 0;
        },
        1);
    lua_setglobal(L, "tell");
    // It tells when its own loop has been compiled, so from there on it runs machine code alone.
    const char* script =
        "jit.attach(function(what) if what == 'stop' then jit.attach(tell) tell() end end, "
        "'trace')\n"
        "local i = 0\n"
        "while true do i = i + 1 end";
    if (luaL_dostring(L, script)) ADD_FAILURE() << lua_tostring(L, -1);
    return 0;
}

TEST(Kill, EndlessCompiledLua) {
    EventHolder isAtWork;
    for (int i = 0; i < 5; i++) {
        ExpectKilled(Start(RunEndlessLua, isAtWork.m_Event, isAtWork.m_Event));
    }
    // The interpreter's library still works.
    lua_State* L = luaL_newstate();
    luaL_openlibs(L);
    EXPECT_EQ(luaL_dostring(L, "local s = 0 for i = 1, 1000 do s = s + i end assert(s == 500500)"),
              0);
    lua_close(L);
}

TEST(Kill, NotYetStarted) {
    static std::atomic<bool> hasRun{false};
    auto body = [](void*) {
        hasRun = true;
        return 0ull;
    };
    _Thread* thread = NewThread(body, nullptr, kThreadSuspended, nullptr);
    ExpectKilled(thread);
    EXPECT_FALSE(hasRun);
}

// Keeps the test and the threads that it starts on one processor, where a thread of the idle policy
// does not run before the test itself sleeps.
class OneProcessor {
public:
    OneProcessor() {
        sched_getaffinity(0, sizeof m_Before, &m_Before);
        cpu_set_t one;
        CPU_ZERO(&one);
        CPU_SET(sched_getcpu(), &one);
        sched_setaffinity(0, sizeof one, &one);
    }
    ~OneProcessor() { sched_setaffinity(0, sizeof m_Before, &m_Before); }

private:
    cpu_set_t m_Before;
};

bool IsAsleep(_Thread* thread) {
    std::ifstream file("/proc/self/task/" + std::to_string(GetThreadID(thread)) + "/stat");
    std::string text;
    std::getline(file, text);
    return text.find(") S ") != std::string::npos;
}

void WaitUntilAsleep(_Thread* thread) {
    unsigned long long limit = GetTimeCount() + kLong / 1000 * GetTimeFreq();
    while (!IsAsleep(thread) && GetTimeCount() < limit) Wait(1);
}

void MakeIdle() {
    sched_param param{};
    pthread_setschedparam(pthread_self(), SCHED_IDLE, &param);
}

TEST(Kill, WaiterLeavesTheEventWhole) {
    OneProcessor oneProcessor;
    for (int i = 0; i < 30; i++) {
        struct Shared {
            EventHolder m_Event, m_IsAtWork;
            std::atomic<int> m_Taken{0};
            std::atomic<int> m_Started{0};
            static unsigned long long WaitForEver(void* argument) {
                auto* shared = static_cast<Shared*>(argument);
                if (shared->m_Started++ == 0) MakeIdle();  // the victim
                SetEvent(shared->m_IsAtWork.m_Event);
                if (WaitEvent(shared->m_Event.m_Event, kNoTimeLimit)) shared->m_Taken++;
                return 0;
            }
        } shared;
        _Event* event = shared.m_Event.m_Event;
        _Thread* victim = Start(Shared::WaitForEver, &shared, shared.m_IsAtWork.m_Event);
        WaitUntilAsleep(victim);  // it is the first in the event's queue
        _Thread* survivor = Start(Shared::WaitForEver, &shared, shared.m_IsAtWork.m_Event);
        WaitUntilAsleep(survivor);
        if (i % 3) {
            // The signal is the victim's. It must not lie there while the other one sleeps.
            SetEvent(event);
            ExpectKilled(victim);
            if (!shared.m_Taken && !WaitThread(survivor, 2000)) {
                EXPECT_FALSE(WaitEvent(event, 0));
            }
        } else {
            ExpectKilled(victim);
        }
        SetEvent(event);
        EXPECT_TRUE(WaitThread(survivor, kLong));
        DeleteThread(survivor);
    }
}

TEST(Kill, WaiterForALockLeavesItWhole) {
    for (int i = 0; i < 50; i++) {
        struct Shared {
            _Mutex* m_Mutex = NewMutex(true);
            EventHolder m_IsAtWork;
            static unsigned long long Obtain(void* argument) {
                auto* shared = static_cast<Shared*>(argument);
                SetEvent(shared->m_IsAtWork.m_Event);
                ObtainMutex(shared->m_Mutex, kNoTimeLimit);
                ReleaseMutex(shared->m_Mutex);
                return 0;
            }
        } shared;
        _Thread* victim = Start(Shared::Obtain, &shared, shared.m_IsAtWork.m_Event);
        _Thread* survivor = Start(Shared::Obtain, &shared, shared.m_IsAtWork.m_Event);
        ExpectKilled(victim);
        ReleaseMutex(shared.m_Mutex);
        EXPECT_TRUE(WaitThread(survivor, kLong));
        DeleteThread(survivor);
        EXPECT_TRUE(ObtainMutex(shared.m_Mutex, 0));
        ReleaseMutex(shared.m_Mutex);
        DeleteMutex(shared.m_Mutex);
    }
}

TEST(Kill, GivesBackTheThreadsFreeBlocks) {
    constexpr unsigned long kSize = 968;  // a class that nothing else here uses
    struct Shared {
        EventHolder m_IsAtWork;
        std::vector<void*> m_Blocks = std::vector<void*>(8);
        static unsigned long long FreeAndLoop(void* argument) {
            auto* shared = static_cast<Shared*>(argument);
            for (void*& block : shared->m_Blocks) block = g_ReusePoolMgr.Alloc(kSize);
            for (void* block : shared->m_Blocks) g_ReusePoolMgr.Free(block);
            return LoopForEver(shared->m_IsAtWork.m_Event);
        }
    } shared;
    g_ReusePoolMgr.FreeAll();
    ExpectKilled(Start(Shared::FreeAndLoop, &shared, shared.m_IsAtWork.m_Event));
    void* block = g_ReusePoolMgr.Alloc(kSize);
    EXPECT_NE(std::find(shared.m_Blocks.begin(), shared.m_Blocks.end(), block),
              shared.m_Blocks.end());
    g_ReusePoolMgr.Free(block);
}

// Threads that do nothing but use pools and queues, killed at any moment.
TEST(Kill, PoolsAndQueuesStayWhole) {
    struct Shared {
        EventQueue m_Queue, m_Back;
        EventHolder m_IsAtWork;

        static void TakeAll(EventQueue& queue) {
            while (QueueNode* node = queue.Get()) node->Reply();
        }
        static unsigned long long Hammer(void* argument) {
            auto* shared = static_cast<Shared*>(argument);
            SetEvent(shared->m_IsAtWork.m_Event);
            std::mt19937 random(5);
            void* blocks[64] = {};
            for (;;) {
                for (void*& block : blocks) {
                    g_ReusePoolMgr.Free(block);
                    block = g_ReusePoolMgr.Alloc(random() % 1500);
                }
                for (unsigned i = 0; i < 8; i++) shared->m_Queue.Put(new QueueNode(i));
                TakeAll(shared->m_Back);
            }
        }
    } shared;
    std::atomic<bool> isOver{false};
    std::atomic<unsigned> echoed{0};
    std::thread echo([&] {
        while (!isOver) {
            shared.m_Queue.Wait(10);
            while (QueueNode* node = shared.m_Queue.Get()) {
                EXPECT_LT(node->GetType(), 8u);
                shared.m_Back.Put(node);
                echoed++;
            }
        }
    });
    std::mt19937 random(11);
    for (int i = 0; i < 150; i++) {
        _Thread* first = Start(Shared::Hammer, &shared, shared.m_IsAtWork.m_Event);
        _Thread* second = Start(Shared::Hammer, &shared, shared.m_IsAtWork.m_Event);
        unsigned long long until = GetTimeCount() + random() % 2'000'000;
        while (GetTimeCount() < until) {
        }
        ExpectKilled(first);
        ExpectKilled(second);
    }
    isOver = true;
    echo.join();
    EXPECT_GT(echoed, 1000u);
    Shared::TakeAll(shared.m_Queue);
    Shared::TakeAll(shared.m_Back);

    // Counts and lists agree: after giving everything back nothing is left, and what goes in
    // counts.
    g_ReusePoolMgr.FreeAll();
    EXPECT_EQ(g_ReusePoolMgr.GetSize(0), 0u);
    g_ReusePoolMgr.Free(g_ReusePoolMgr.Alloc(64));
    EXPECT_EQ(g_ReusePoolMgr.GetSize(0), 64u + 16u);
}

TEST(Kill, RacesWithTheEndOfTheBody) {
    std::atomic<int> ended{0};
    auto body = [](void* argument) {
        ++*static_cast<std::atomic<int>*>(argument);
        return 0ull;
    };
    std::mt19937 random(3);
    for (int i = 0; i < 600; i++) {
        _Thread* thread = NewThread(body, &ended, 0, nullptr);
        unsigned long long until = GetTimeCount() + random() % 100'000;
        while (GetTimeCount() < until) {
        }
        ExpectKilled(thread);
    }
    EXPECT_GT(ended, 0);
}

TEST(Kill, SeveralKillersAndAWaiter) {
    EventHolder isAtWork;
    for (int i = 0; i < 100; i++) {
        _Thread* thread = Start(LoopForEver, isAtWork.m_Event, isAtWork.m_Event);
        std::thread waiter([&] { EXPECT_TRUE(WaitThread(thread, kLong)); });
        std::thread killer([&] { EXPECT_TRUE(KillThread(thread, 0)); });
        EXPECT_TRUE(KillThread(thread, 0));
        EXPECT_TRUE(WaitThread(thread, 0));
        waiter.join();
        killer.join();
        DeleteThread(thread);
    }
}

TEST(Kill, Itself) {
    static std::atomic<bool> isPast{false};
    auto body = [](void* go) {
        WaitEvent(static_cast<_Event*>(go), kLong);
        KillThread(GetCurrentThread(), 0);
        isPast = true;
        return 0ull;
    };
    EventHolder go;
    for (int i = 0; i < 100; i++) {
        _Thread* thread = NewThread(body, go.m_Event, 0, nullptr);
        unsigned long long id = GetThreadID(thread);
        if (i % 2) {
            SetEvent(go.m_Event);
            EXPECT_TRUE(WaitThread(thread, kLong));
            EXPECT_TRUE(IsGone(id));
            DeleteThread(thread);
        } else {
            DeleteThread(thread);  // the body's reference is the last
            SetEvent(go.m_Event);
            EXPECT_TRUE(IsGone(id));
        }
    }
    EXPECT_FALSE(isPast);
}

TEST(Kill, WaitsForTheEndOfAGuardAndGivesUp) {
    struct Shared {
        EventHolder m_IsAtWork;
        std::atomic<unsigned long long> m_GuardNs{0};
        std::atomic<bool> m_IsGuardOver{false};
        static unsigned long long StayGuarded(void* argument) {
            auto* shared = static_cast<Shared*>(argument);
            {
                NoKill noKill;
                SetEvent(shared->m_IsAtWork.m_Event);
                unsigned long long until = GetTimeCount() + shared->m_GuardNs;
                while (GetTimeCount() < until && !shared->m_IsGuardOver) {
                }
                shared->m_IsGuardOver = true;
            }
            for (std::atomic<unsigned> i{0};; i++) {
            }
        }
    } shared;
    shared.m_GuardNs = 100'000'000;
    _Thread* thread = Start(Shared::StayGuarded, &shared, shared.m_IsAtWork.m_Event);
    ExpectKilled(thread);
    EXPECT_TRUE(shared.m_IsGuardOver);

    shared.m_IsGuardOver = false;
    shared.m_GuardNs = ~0ull >> 1;
    thread = Start(Shared::StayGuarded, &shared, shared.m_IsAtWork.m_Event);
    EXPECT_FALSE(KillThread(thread, 0));
    EXPECT_FALSE(HasThreadQuit(thread));
    shared.m_IsGuardOver = true;
    EXPECT_FALSE(WaitThread(thread, 50));  // no signal is left over from the kill that gave up
    ExpectKilled(thread);
}

// What the dead thread kept under its keys must not turn up in the next thread on the same stack.
TEST(Kill, KeysDoNotOutliveTheThread) {
    static pthread_key_t key;
    static std::atomic<int> foreign{0};
    ASSERT_EQ(pthread_key_create(&key, [](void*) { foreign++; }), 0);
    auto body = [](void* isAtWork) {
        pthread_setspecific(key, isAtWork);
        return LoopForEver(isAtWork);
    };
    EventHolder isAtWork;
    for (int i = 0; i < 20; i++) {
        ExpectKilled(Start(body, isAtWork.m_Event, isAtWork.m_Event));
        std::thread([] {
            if (pthread_getspecific(key)) foreign++;
        }).join();
    }
    EXPECT_EQ(foreign, 0);
    pthread_key_delete(key);
}

TEST(Kill, SignalIsRefusedToStrangersAndIgnoredWithoutAKill) {
    EventHolder isAtWork;
    _Thread* thread = Start(LoopForEver, isAtWork.m_Event, isAtWork.m_Event);
    EXPECT_FALSE(SetKillSignal(SIGUSR2));  // too late

    int number = SIGRTMIN + 6;
    struct sigaction ours = {}, strangers = {};
    strangers.sa_handler = [](int) {};
    sigaction(number, &strangers, &ours);
    EXPECT_FALSE(KillThread(thread, 0));
    EXPECT_FALSE(HasThreadQuit(thread));
    sigaction(number, &ours, nullptr);

    if (ours.sa_handler == SIG_DFL) {  // this test runs alone
        ExpectKilled(Start(LoopForEver, isAtWork.m_Event, isAtWork.m_Event));
    }
    syscall(SYS_tgkill, getpid(), static_cast<pid_t>(GetThreadID(thread)), number);
    raise(number);
    EXPECT_FALSE(WaitThread(thread, 50));
    ExpectKilled(thread);
}

TEST(Kill, SignalCanBeMovedFirst) {
    auto moved = [] {
        if (SetKillSignal(SIGKILL) || SetKillSignal(0) || SetKillSignal(SIGRTMIN - 1)) _exit(2);
        if (!SetKillSignal(SIGUSR2)) _exit(3);
        struct sigaction action = {};
        action.sa_handler = [](int) { _exit(4); };
        sigaction(SIGRTMIN + 6, &action, nullptr);
        EventHolder isAtWork;
        _Thread* thread = NewThread(LoopForEver, isAtWork.m_Event, 0, nullptr);
        bool isKilled = WaitEvent(isAtWork.m_Event, kLong) && KillThread(thread, 0);
        _exit(isKilled ? 7 : 5);
    };
    testing::GTEST_FLAG(death_test_style) = "threadsafe";  // a process that has made no threads yet
    EXPECT_EXIT(moved(), testing::ExitedWithCode(7), "");
}

}  // namespace
}  // namespace Korvel::Platform

#include "Platform/Threads.h"

#include <gtest/gtest.h>
#include <langinfo.h>
#include <pthread.h>
#include <sched.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <clocale>
#include <cstring>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "Platform/Events.h"
#include "Platform/Time.h"
#include "core/FaultsInternal.h"

namespace Korvel::Platform {
namespace {

constexpr unsigned kLong = 20000;  // only ever reached by a failure

unsigned long long CallFunction(void* function) {
    (*static_cast<std::function<void()>*>(function))();
    return 0;
}

// Runs `body` on a thread of NewThread and waits for its end.
void RunOnThread(std::function<void()> body) {
    _Thread* thread = NewThread(CallFunction, &body, 0, nullptr);
    ASSERT_NE(thread, nullptr);
    EXPECT_TRUE(WaitThread(thread, kLong));
    DeleteThread(thread);
}

TEST(Threads, IDIsKnownBeforeTheBodyStarts) {
    for (int i = 0; i < 200; i++) {
        unsigned long long id = 0, idInBody = 1, systemID = 2;
        _Thread* self = nullptr;
        std::function<void()> body = [&] {
            idInBody = id;
            systemID = static_cast<unsigned long long>(gettid());
            self = GetCurrentThread();
            EXPECT_EQ(GetCurrentThreadID(), systemID);
        };
        _Thread* thread = NewThread(CallFunction, &body, 0, &id);
        ASSERT_TRUE(WaitThread(thread, kLong));
        EXPECT_EQ(id, idInBody);
        EXPECT_EQ(id, systemID);
        EXPECT_EQ(id, GetThreadID(thread));
        EXPECT_EQ(self, thread);
        DeleteThread(thread);
    }
}

TEST(Threads, SuspendedBodyWaitsForResume) {
    std::atomic<bool> hasRun{false};
    std::function<void()> body = [&] { hasRun = true; };
    unsigned long long id = 0;
    _Thread* thread = NewThread(CallFunction, &body, kThreadSuspended, &id);
    EXPECT_NE(id, 0u);
    EXPECT_TRUE(SuspendThread(thread));
    EXPECT_FALSE(WaitThread(thread, 50));
    EXPECT_FALSE(HasThreadQuit(thread));
    EXPECT_FALSE(hasRun);
    EXPECT_TRUE(ResumeThread(thread));
    EXPECT_TRUE(WaitThread(thread, kLong));
    EXPECT_TRUE(hasRun);
    EXPECT_TRUE(ResumeThread(thread));
    DeleteThread(thread);
}

TEST(Threads, StateOfABody) {
    ASSERT_NE(setlocale(LC_ALL, "C.UTF-8"), nullptr);
    volatile float tiny = 1e-38f;
    RunOnThread([&] {
        EXPECT_STREQ(nl_langinfo(CODESET), "ANSI_X3.4-1968");
#if defined(__x86_64__)
        EXPECT_EQ(tiny / 16, 0);
#endif
    });
    EXPECT_STREQ(nl_langinfo(CODESET), "UTF-8");  // the locale is the thread's own
    EXPECT_NE(tiny / 16, 0);
    std::thread([&] {
        InitThread();
        EXPECT_STREQ(nl_langinfo(CODESET), "ANSI_X3.4-1968");
    }).join();
    setlocale(LC_ALL, "C");
}

TEST(Threads, JoinsOnceInWhateverWay) {
    std::function<void()> nothing = [] {};
    for (int way = 0; way < 4; way++) {
        _Thread* thread = NewThread(CallFunction, &nothing, 0, nullptr);
        if (way == 0) {
            EXPECT_TRUE(WaitThread(thread, kLong));
        }
        if (way == 1) {
            while (!HasThreadQuit(thread)) Wait(1);
        }
        if (way == 2) {
            EXPECT_TRUE(WaitAllThreads(1, &thread, kLong));
        }
        if (way == 3) {
            EXPECT_TRUE(WaitAllThreads(1, &thread, kNoTimeLimit));
        }
        EXPECT_TRUE(HasThreadQuit(thread));
        EXPECT_TRUE(WaitThread(thread, 0));
        EXPECT_TRUE(WaitThread(thread, kNoTimeLimit));
        EXPECT_TRUE(WaitAllThreads(1, &thread, kNoTimeLimit));
        EXPECT_TRUE(KillThread(thread, 0));
        SetThreadPriority(thread, 6);  // must not reach the system any more
        EXPECT_EQ(GetThreadPriority(thread), kDefaultThreadPri);
        DeleteThread(thread);
    }
}

// Waiters, lookers and the creator's farewell race with the end of the body.
TEST(Threads, EndsUnderManyEyes) {
    for (int i = 0; i < 300; i++) {
        _Event* go = NewEvent(true, false);
        std::function<void()> body = [&] { WaitEvent(go, kLong); };
        _Thread* thread = NewThread(CallFunction, &body, 0, nullptr);
        std::thread waiter([&] { EXPECT_TRUE(WaitThread(thread, kLong)); });
        std::thread looker([&] {
            while (!HasThreadQuit(thread)) std::this_thread::yield();
        });
        SetEvent(go);
        if (i % 2) {
            EXPECT_TRUE(WaitThread(thread, kLong));
        }
        waiter.join();
        looker.join();
        DeleteThread(thread);
        DeleteEvent(go);
    }
    // Nobody joins: the last of the two holders has to detach.
    for (int i = 0; i < 300; i++) {
        _Event* go = NewEvent(false, false);
        std::atomic<bool> isOver{false};
        std::function<void()> body = [&] {
            WaitEvent(go, kLong);
            isOver = true;
        };
        _Thread* thread = NewThread(CallFunction, &body, 0, nullptr);
        if (i % 2) DeleteThread(thread);
        SetEvent(go);
        while (!isOver) std::this_thread::yield();
        if (i % 2 == 0) DeleteThread(thread);
        DeleteEvent(go);
    }
}

TEST(Threads, BodyMayLeaveByThreadExit) {
    std::atomic<bool> isPast{false};
    RunOnThread([&] {
        pthread_exit(nullptr);
        isPast = true;
    });
    EXPECT_FALSE(isPast);
}

TEST(Threads, WaitAllHasALimit) {
    EXPECT_FALSE(WaitAllThreads(0, nullptr, 0));
    EXPECT_TRUE(WaitAllThreads(0, nullptr, 1000));
    _Event* go = NewEvent(true, false);
    std::function<void()> nothing = [] {}, waits = [&] { WaitEvent(go, kLong); };
    _Thread* threads[] = {NewThread(CallFunction, &nothing, 0, nullptr),
                          NewThread(CallFunction, &waits, 0, nullptr)};
    EXPECT_FALSE(WaitAllThreads(2, threads, 40));
    SetEvent(go);
    EXPECT_TRUE(WaitAllThreads(2, threads, kLong));
    for (_Thread* thread : threads) DeleteThread(thread);
    DeleteEvent(go);
}

TEST(Threads, RecordsWithoutAThread) {
    _Thread* bare = CreateThreadStruct(false);
    EXPECT_EQ(GetThreadID(bare), 0u);
    EXPECT_TRUE(WaitThread(bare, kNoTimeLimit));
    EXPECT_TRUE(HasThreadQuit(bare));
    EXPECT_FALSE(KillThread(bare, 0));
    EXPECT_EQ(GetThreadPriority(bare), kDefaultThreadPri);
    DeleteThread(bare);
    _Thread* withEvent = CreateThreadStruct(true);
    EXPECT_FALSE(WaitThread(withEvent, 0));
    DeleteThread(withEvent);
    DeleteThread(withEvent);  // it has two references
    DeleteThread(nullptr);
    EXPECT_FALSE(KillThread(nullptr, 0));
}

TEST(Threads, AdoptsTheHostsThreads) {
    std::thread([] {
        EXPECT_EQ(GetCurrentThreadID(), static_cast<unsigned long long>(gettid()));
        _Thread* self = GetCurrentThread();
        _SetCurrentThread();
        EXPECT_EQ(GetCurrentThread(), self);
        EXPECT_EQ(GetThreadID(self), GetCurrentThreadID());
        EXPECT_FALSE(HasThreadQuit(self));
        EXPECT_FALSE(KillThread(self, 0));
    }).join();
}

TEST(Threads, ForkedChildHasItsOwnID) {
    unsigned long long parentID = GetCurrentThreadID();
    pid_t child = fork();
    if (child == 0) {
        unsigned long long id = GetCurrentThreadID();
        bool isRight = id == static_cast<unsigned long long>(gettid()) && id != parentID &&
                       GetThreadID(GetCurrentThread()) == id;
        _exit(isRight ? 7 : 1);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(WEXITSTATUS(status), 7);
    EXPECT_EQ(GetCurrentThreadID(), parentID);
}

TEST(Threads, PriorityScale) {
    RunOnThread([] {
        EXPECT_EQ(GetThreadPriority(GetCurrentThread()), 3u);  // one priority, so the middle
        SetThreadPriority(GetCurrentThread(), 0);
        EXPECT_EQ(GetThreadPriority(GetCurrentThread()), 3u);

        sched_param param{1};
        if (pthread_setschedparam(pthread_self(), SCHED_RR, &param) != 0) return;  // not allowed
        const int expected[] = {1, 17, 33, 50, 66, 82, 99};  // 1 + pri * 98 / 6, truncated
        for (ThreadPri pri = 0; pri <= 6; pri++) {
            SetThreadPriority(GetCurrentThread(), pri);
            SetThreadPriority(GetCurrentThread(), 7);  // changes nothing
            int policy;
            pthread_getschedparam(pthread_self(), &policy, &param);
            EXPECT_EQ(param.sched_priority, expected[pri]);
            EXPECT_EQ(GetThreadPriority(GetCurrentThread()), pri);
        }
    });
}

TEST(Threads, NamesKeepWholeCharacters) {
    const char* cases[][2] = {
        {"ScriptState", "ScriptState"},
        {"123456789012345", "123456789012345"},
        {"RemoteApp [Connect]", "RemoteApp [Conn"},
        {"12345678901234\xC3\xA4", "12345678901234"},  // would end between the two bytes
        {"1234567890123\xC3\xA4x", "1234567890123\xC3\xA4"},
        {"12345678901\xF0\x9F\x98\x80", "12345678901\xF0\x9F\x98\x80"},
        {"123456789012\xF0\x9F\x98\x80", "123456789012"},
        {"\x80\x80\x80\x80\x80\x80\x80\x80\x80\x80\x80\x80\x80\x80\x80\x80\x80", ""},
    };
    RunOnThread([&] {
        for (auto& [name, expected] : cases) {
            SetThreadName(name, nullptr);
            char buffer[32] = "";
            pthread_getname_np(pthread_self(), buffer, sizeof buffer);
            EXPECT_STREQ(buffer, expected);
        }
        SetThreadName(nullptr, nullptr);
    });
}

TEST(Threads, IdealCountIsTheSystems) {
    EXPECT_EQ(GetIdealThreadCount(), static_cast<unsigned>(sysconf(_SC_NPROCESSORS_ONLN)));
}

#ifdef KORVEL_FAULTS
TEST(Threads, OutOfMemory) {
    for (unsigned n = 1; n <= 2; n++) {
        std::function<void()> nothing = [] {};
        Faults::FailAt(n, false);
        EXPECT_EQ(NewThread(CallFunction, &nothing, 0, nullptr), nullptr);
        EXPECT_EQ(Faults::Stop(), n);
    }
    Faults::FailAt(1, true);
    EXPECT_EQ(NewEvent(false, false), nullptr);
    std::thread([] {
        EXPECT_EQ(GetCurrentThreadID(), static_cast<unsigned long long>(gettid()));
        EXPECT_EQ(GetCurrentThread(), nullptr);
    }).join();
    Faults::Stop();
}
#endif

}  // namespace
}  // namespace Korvel::Platform

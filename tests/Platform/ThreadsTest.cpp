#include "Platform/Threads.h"

#include <gtest/gtest.h>
#include <langinfo.h>
#include <pthread.h>
#include <unistd.h>

#include <atomic>
#include <bit>
#include <clocale>
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

using Body = std::function<void()>;

_Thread* Start(Body& body, unsigned flags = 0, unsigned long long* idOut = nullptr) {
    auto call = [](void* function) {
        (*static_cast<Body*>(function))();
        return 0ull;
    };
    return NewThread(call, &body, flags, idOut);
}

void RunOnThread(Body body) {
    _Thread* thread = Start(body);
    EXPECT_TRUE(WaitThread(thread, kLong));
    DeleteThread(thread);
}

unsigned long long SystemID() {
    return static_cast<unsigned long long>(gettid());
}

TEST(Threads, SuspendedBodyWaitsForResume) {
    EXPECT_FALSE(WaitAllThreads(0, nullptr, 0));
    EXPECT_TRUE(WaitAllThreads(0, nullptr, 1000));
    std::atomic<int> runs{0};
    Body count = [&] { runs++; };
    _Thread* threads[] = {Start(count), Start(count, kThreadSuspended)};
    EXPECT_TRUE(WaitThread(threads[0], kLong));
    EXPECT_TRUE(SuspendThread(threads[1]));
    EXPECT_FALSE(WaitAllThreads(2, threads, 50));
    EXPECT_FALSE(WaitThread(threads[1], 1) || HasThreadQuit(threads[1]));
    EXPECT_EQ(runs, 1);
    EXPECT_TRUE(ResumeThread(threads[1]));
    EXPECT_TRUE(WaitAllThreads(2, threads, kLong));
    EXPECT_TRUE(ResumeThread(threads[1]));
    EXPECT_EQ(runs, 2);
    for (_Thread* thread : threads) DeleteThread(thread);
}

TEST(Threads, StateOfABody) {
    ASSERT_NE(setlocale(LC_ALL, "C.UTF-8"), nullptr);
    volatile float least = 2e-38f, denormal = 1e-38f;
    auto check = [&] {
        EXPECT_STREQ(nl_langinfo(CODESET), "ANSI_X3.4-1968");
#if defined(__x86_64__)
        // Its bits, for here a denormal number compares equal to zero.
        EXPECT_EQ(std::bit_cast<unsigned>(least / 16), 0u);
        EXPECT_EQ(denormal * 16, 0);
#endif
    };
    RunOnThread(check);
    std::thread([&] {
        EXPECT_NE(least / 16, 0);
        InitThread();
        check();
    }).join();
    EXPECT_STREQ(nl_langinfo(CODESET), "UTF-8");  // the locale is the thread's own
    setlocale(LC_ALL, "C");
}

bool LookUntilGone(_Thread* thread) {
    while (!HasThreadQuit(thread)) std::this_thread::yield();
    return true;
}

// Each way to join alone, then with others that wait and look at the same time, then none: the last
// of the two holders has to detach.
TEST(Threads, EndsUnderManyEyes) {
    bool (*const ways[])(_Thread*) = {
        [](_Thread* t) { return WaitThread(t, kLong); },
        LookUntilGone,
        [](_Thread* t) { return WaitAllThreads(1, &t, kLong); },
        [](_Thread* t) { return WaitAllThreads(1, &t, kNoTimeLimit); },
    };
    for (unsigned i = 0; i < 600; i++) {
        _Event* go = NewEvent(true, false);
        std::atomic<bool> isOver{false};
        unsigned long long id = 0;
        _Thread* thread = nullptr;
        Body body = [&] {
            bool exits = i % 3 == 0;
            EXPECT_EQ(id, SystemID());
            WaitEvent(go, kLong);
            EXPECT_EQ(GetCurrentThread(), thread);
            EXPECT_EQ(GetThreadID(GetCurrentThread()), id);
            isOver = true;  // after this nothing here may be used
            if (exits) pthread_exit(nullptr);
        };
        thread = Start(body, 0, &id);
        std::vector<std::thread> eyes;
        for (auto way : {ways[0], ways[1]}) {
            if (i >= 4 && i < 300) eyes.emplace_back(way, thread);
        }
        bool isDeletedFirst = i >= 300 && i % 2;
        if (isDeletedFirst) DeleteThread(thread);
        SetEvent(go);
        EXPECT_TRUE(i >= 300 || ways[i % 4](thread));
        while (!isOver) std::this_thread::yield();
        for (std::thread& eye : eyes) eye.join();
        if (i < 300) {
            EXPECT_TRUE(WaitThread(thread, 0) && HasThreadQuit(thread));
            EXPECT_TRUE(WaitAllThreads(1, &thread, kNoTimeLimit) && KillThread(thread, 0));
            SetThreadPriority(thread, 6);  // must not reach the system any more
            EXPECT_EQ(GetThreadPriority(thread), kDefaultThreadPri);
        }
        if (!isDeletedFirst) DeleteThread(thread);
        DeleteEvent(go);
    }
}

TEST(Threads, RecordsThatNewThreadHasNotMade) {
    _Thread* bare = CreateThreadStruct(false);
    EXPECT_EQ(GetThreadID(bare), 0u);
    EXPECT_TRUE(WaitThread(bare, kNoTimeLimit) && HasThreadQuit(bare));
    EXPECT_FALSE(KillThread(bare, 0) || KillThread(nullptr, 0));
    EXPECT_EQ(GetThreadPriority(bare), kDefaultThreadPri);
    DeleteThread(bare);
    _Thread* withEvent = CreateThreadStruct(true);
    EXPECT_FALSE(WaitThread(withEvent, 0));
    DeleteThread(withEvent);
    DeleteThread(withEvent);  // it has two references
    DeleteThread(nullptr);

    bool hasSurvived = false;
    std::thread([&] {
        EXPECT_EQ(GetCurrentThreadID(), SystemID());
        _Thread* self = GetCurrentThread();
        _SetCurrentThread();
        EXPECT_EQ(GetCurrentThread(), self);
        EXPECT_EQ(GetThreadID(self), SystemID());
        EXPECT_FALSE(HasThreadQuit(self) || KillThread(self, 0));
        hasSurvived = true;
    }).join();
    EXPECT_TRUE(hasSurvived);
}

TEST(Threads, ForkedChildHasItsOwnID) {
    unsigned long long parentID = GetCurrentThreadID();
    testing::GTEST_FLAG(death_test_style) = "fast";  // a fork alone
    auto isRight = [] { return GetThreadID(GetCurrentThread()) == SystemID(); };
    EXPECT_EXIT(_exit(isRight() && GetCurrentThreadID() == SystemID() ? 7 : 1),
                testing::ExitedWithCode(7), "");
    EXPECT_EQ(GetCurrentThreadID(), parentID);
}

TEST(Threads, PriorityScale) {
    RunOnThread([] {
        _Thread* self = GetCurrentThread();
        SetThreadPriority(self, 0);
        EXPECT_EQ(GetThreadPriority(self), 3u);  // one priority, so the middle

        sched_param param{1};
        if (pthread_setschedparam(pthread_self(), SCHED_RR, &param) != 0) return;  // not allowed
        const int expected[] = {1, 17, 33, 50, 66, 82, 99};  // 1 + pri * 98 / 6, truncated
        for (ThreadPri pri = 0; pri <= 6; pri++) {
            SetThreadPriority(self, pri);
            SetThreadPriority(self, 7);  // changes nothing
            int policy;
            pthread_getschedparam(pthread_self(), &policy, &param);
            EXPECT_EQ(param.sched_priority, expected[pri]);
            EXPECT_EQ(GetThreadPriority(self), pri);
        }
    });
}

TEST(Threads, NamesKeepWholeCharacters) {
    auto nameAfter = [](const std::string& name) {
        SetThreadName(name.c_str(), nullptr);
        SetThreadName(nullptr, nullptr);
        char buffer[32] = "";
        pthread_getname_np(pthread_self(), buffer, sizeof buffer);
        return std::string(buffer);
    };
    RunOnThread([&] {
        for (std::string last : {"y", "\xC3\xA4", "\xF0\x9F\x98\x80"}) {
            for (size_t length = 10; length < 18; length++) {
                std::string head(length, 'x'), kept = length + last.size() <= 15 ? last : "";
                EXPECT_EQ(nameAfter(head + last), head.substr(0, 15) + kept);
            }
        }
        EXPECT_EQ(nameAfter(std::string(17, '\x80')), "");
    });
}

#ifdef KORVEL_FAULTS
TEST(Threads, OutOfMemory) {
    Body nothing = [] {};
    for (unsigned n = 1; n <= 2; n++) {
        Faults::FailAt(n, false);
        EXPECT_EQ(Start(nothing), nullptr);
        EXPECT_EQ(Faults::Stop(), n);
    }
    Faults::FailAt(1, true);
    EXPECT_EQ(NewEvent(false, false), nullptr);
    std::thread([] {
        EXPECT_EQ(GetCurrentThreadID(), SystemID());
        EXPECT_EQ(GetCurrentThread(), nullptr);
    }).join();
    Faults::Stop();
}
#endif

}  // namespace
}  // namespace Korvel::Platform

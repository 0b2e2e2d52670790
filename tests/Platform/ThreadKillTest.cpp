// Thread objects, and what they lock, when threads are killed. Part of the program of KillTest.cpp.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "Platform/Event.h"
#include "Platform/Thread.h"
#include "Platform/Threads.h"
#include "core/SpinLock.h"

namespace Korvel::KorvelScript {
namespace {

constexpr unsigned kLong = 20000;  // only ever reached by a failure

struct Endless : Thread {
    int Main() override {
        s_IsAtWork.Signal();
        for (std::atomic<unsigned> i{0};; i++) continue;
    }
    static inline Event s_IsAtWork;
};

TEST(ThreadKill, LeavesTheObjectToItsOwner) {
    Endless thread;
    thread.SetDeleteOnQuit(true);
    for (int i = 0; i < 3; i++) {
        ASSERT_NE(thread.Start(), nullptr);
        EXPECT_TRUE(Endless::s_IsAtWork.Wait(kLong));
        EXPECT_TRUE(thread.KillThread());
        EXPECT_TRUE(!thread.IsRunning() && !thread.GetThread() && !thread.KillThread());
    }
}

TEST(ThreadKill, TheDestructorGivesTheBodyTenSeconds) {
    Endless* thread = new Endless;
    ASSERT_NE(thread->Start(), nullptr);
    EXPECT_TRUE(Endless::s_IsAtWork.Wait(kLong));
    auto begin = std::chrono::steady_clock::now();
    delete thread;
    EXPECT_GE(std::chrono::steady_clock::now() - begin, std::chrono::milliseconds(9990));
}

// The kill finds that the body has ended by itself, and that the object has been started again.
TEST(ThreadKill, AKillThatComesLateLeavesTheNextBodyAlone) {
    struct Short : Thread {
        int Main() override {
            unsigned long long self = Platform::GetCurrentThreadID();
            m_Current = self;
            for (int i = 0; i < 300; i++) m_Overlaps += m_Current != self;
            return 0;
        }
        std::atomic<unsigned long long> m_Current{0};
        std::atomic<int> m_Overlaps{0};
    };
    Short object;
    std::atomic<bool> isDone{false};
    std::thread killer([&] {
        while (!isDone) object.KillThread();
    });
    for (int i = 0; i < 3000; i++) {
        while (!object.Start()) std::this_thread::yield();
    }
    isDone = true;
    killer.join();
    while (object.IsRunning()) std::this_thread::yield();
    EXPECT_EQ(object.m_Overlaps, 0);
}

TEST(ThreadKill, AThreadMayKillItself) {
    struct Suicide : Thread {
        int Main() override {
            KillThread();
            ADD_FAILURE() << "still there";
            return 0;
        }
    };
    Suicide thread;
    for (int i = 0; i < 3; i++) {
        ASSERT_NE(thread.Start(), nullptr);
        while (thread.IsRunning()) std::this_thread::yield();
    }
}

// Neither a holder nor a waiter leaves a nested spin lock taken.
TEST(ThreadKill, NestedSpinLocksAreNotOrphaned) {
    struct Locker : Thread {
        int Main() override {
            for (;;) {
                AutoNestedSpinLock outer(m_Lock);
                AutoNestedSpinLock inner(m_Lock);
                m_Count++;
            }
        }
        NestedSpinLock m_Lock;
        int m_Count = 0;
    };
    Locker threads[2];
    for (int i = 0; i < 100; i++) {
        Locker& locker = threads[i % 2];
        ASSERT_NE(locker.Start(), nullptr);
        for (int seen = 0; seen < 10;) {
            AutoNestedSpinLock guard(locker.m_Lock);
            seen = locker.m_Count;
        }
        EXPECT_TRUE(locker.KillThread());
        AutoNestedSpinLock guard(locker.m_Lock);
        locker.m_Count = 0;
    }
    // One that only waits is gone at once, though the lock stays taken.
    AutoNestedSpinLock guard(threads[0].m_Lock);
    ASSERT_NE(threads[0].Start(), nullptr);
    EXPECT_TRUE(threads[0].KillThread());
    EXPECT_EQ(threads[0].m_Count, 0);
}

}  // namespace
}  // namespace Korvel::KorvelScript

#include "Platform/Events.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <thread>
#include <vector>

#include "Platform/Lock.h"
#include "Platform/Mutex.h"
#include "Platform/Time.h"

namespace Korvel::Platform {
namespace {

constexpr unsigned kLong = 20000;  // only ever reached by a failure

bool TryFromAnotherThread(_Mutex* mutex) {
    bool isObtained = false;
    std::thread([&] {
        isObtained = ObtainMutex(mutex, 0);
        if (isObtained) ReleaseMutex(mutex);
    }).join();
    return isObtained;
}

TEST(Events, SignalsByKindAndState) {
    struct Case {
        bool manualReset, initialState;
        const char* operations;  // S set, R reset, P pulse, 0 and 1 a look with what it must see
    };
    const Case cases[] = {
        {false, false, "0SS10"},    // two signals are one
        {false, true, "10"},        // a look consumes the signal
        {false, false, "P0SP0S1"},  // a pulse that nobody sees leaves nothing, not even what was
                                    // set
        {false, true, "R0"},
        {true, false, "0S111R0"},
        {true, true, "11P0"},
    };
    for (const Case& c : cases) {
        _Event* event = NewEvent(c.manualReset, c.initialState);
        for (const char* p = c.operations; *p; p++) {
            if (*p == 'S') SetEvent(event);
            if (*p == 'R') ResetEvent(event);
            if (*p == 'P') PulseEvent(event);
            // Looks in all forms see the same where they do not have to wait.
            if (*p == '0' || *p == '1') {
                unsigned timeoutMs = p[1] ? 0 : *p == '1' ? kNoTimeLimit : 1;
                EXPECT_EQ(WaitEvent(event, timeoutMs), *p == '1') << c.operations;
            }
        }
        DeleteEvent(event);
    }
    SetEvent(nullptr);
    PulseEvent(nullptr);
    EXPECT_FALSE(WaitEvent(nullptr, kNoTimeLimit));
    DeleteEvent(nullptr);
}

TEST(Events, WaitTakesItsTimeAndNotMore) {
    _Event* event = NewEvent(false, false);
    for (unsigned ms : {1u, 60u}) {
        unsigned long long start = GetTimeCount();
        EXPECT_FALSE(WaitEvent(event, ms));
        unsigned long long tookMs = (GetTimeCount() - start) / (GetTimeFreq() / 1000);
        EXPECT_GE(tookMs + 2, ms);
        EXPECT_LT(tookMs, ms + 5000);
    }
    DeleteEvent(event);
}

TEST(Events, WaitAllStopsAtTheFirstFailure) {
    EXPECT_TRUE(WaitAllEvents(0, nullptr, 0));
    _Event* events[] = {NewEvent(false, true), NewEvent(false, false), NewEvent(false, true)};
    EXPECT_FALSE(WaitAllEvents(3, events, 1));
    EXPECT_FALSE(WaitEvent(events[0], 0));  // was waited for
    EXPECT_TRUE(WaitEvent(events[2], 0));   // was not reached
    for (_Event* event : events) SetEvent(event);
    EXPECT_TRUE(WaitAllEvents(3, events, 1));
    for (_Event* event : events) DeleteEvent(event);
}

// Each signal of an auto-reset event lets one of many waiters through, and none is lost.
TEST(Events, OneWaiterPerSignal) {
    constexpr int kRounds = 4000;
    _Event* event = NewEvent(false, false);
    _Event* taken = NewEvent(false, false);
    std::atomic<int> takenCount{0};
    std::atomic<bool> isOver{false};
    std::vector<std::thread> waiters;
    for (int i = 0; i < 4; i++) {
        // One of them has a limit that often runs out while a signal is on its way.
        waiters.emplace_back([&, limit = i ? kNoTimeLimit : 1u] {
            while (!isOver) {
                if (!WaitEvent(event, limit) || isOver) continue;
                takenCount++;
                SetEvent(taken);
            }
            SetEvent(event);
        });
    }
    for (int i = 1; i <= kRounds; i++) {
        SetEvent(event);
        ASSERT_TRUE(WaitEvent(taken, kLong));
        ASSERT_EQ(takenCount, i);
    }
    // The waiters share signals, so each that leaves signals for the next.
    isOver = true;
    SetEvent(event);
    for (std::thread& waiter : waiters) waiter.join();
    DeleteEvent(event);
    DeleteEvent(taken);
}

TEST(Events, ManualResetWakesAllAndWaitersMayDelete) {
    for (int round = 0; round < 300; round++) {
        _Event* gate = NewEvent(true, false);
        std::atomic<int> left{3};
        std::vector<std::thread> waiters;
        for (int i = 0; i < 3; i++) {
            waiters.emplace_back([&] {
                EXPECT_TRUE(WaitEvent(gate, kLong));
                // The last one deletes it, perhaps before SetEvent has returned.
                if (--left == 0) DeleteEvent(gate);
            });
        }
        SetEvent(gate);
        for (std::thread& waiter : waiters) waiter.join();
    }
}

// A look must not block on a thread that has the event in hand, though the event is set.
TEST(Events, LookGivesUpOnABusyEvent) {
    _Event* event = NewEvent(true, true);
    std::atomic<bool> isOver{false};
    std::thread other([&] {
        while (!isOver) SetEvent(event);
    });
    unsigned long long limit = GetTimeCount() + 20 * GetTimeFreq();
    bool wasBusy = false;
    while (!wasBusy && GetTimeCount() < limit) wasBusy = !WaitEvent(event, 0);
    EXPECT_TRUE(wasBusy);
    isOver = true;
    other.join();
    DeleteEvent(event);
}

TEST(Mutex, NestsOnOneThread) {
    _Mutex* mutex = NewMutex(true);
    EXPECT_TRUE(ObtainMutex(mutex, 0));
    EXPECT_FALSE(TryFromAnotherThread(mutex));
    ReleaseMutex(mutex);
    EXPECT_FALSE(TryFromAnotherThread(mutex));
    ReleaseMutex(mutex);
    EXPECT_TRUE(TryFromAnotherThread(mutex));
    DeleteMutex(mutex);
    EXPECT_FALSE(ObtainMutex(nullptr, kNoTimeLimit));
    ReleaseMutex(nullptr);
    DeleteMutex(nullptr);
}

TEST(Mutex, CriticalSectionStartsAtZero) {
    _CriticalSection section;
    memset(&section, 0xFF, sizeof section);
    InitCriticalSection(&section, 4000);
    int count = -1;
    EXPECT_EQ(sem_getvalue(&section.m_Semaphore, &count), 0);
    EXPECT_EQ(count, 0);
    EXPECT_EQ(section.m_Owner, 0);
    EXPECT_EQ(section.m_Depth, 0);
    DeleteCriticalSection(&section);
}

class Account {
public:
    void Add(int n) {
        KorvelScript::AutoLock guard(m_Lock);
        for (int i = 0; i < n; i++) AddOneLocked();
    }
    void AddTwice(int n) {
        KorvelScript::AutoLock guard(m_Lock);
        Add(n);  // takes the lock that this thread has
        Add(n);
    }
    int Get() {
        KorvelScript::AutoLock guard(m_Lock);
        return m_Sum;
    }

private:
    void AddOneLocked() KORVEL_REQUIRES(m_Lock) { m_Sum++; }

    KorvelScript::Lock m_Lock;
    int m_Sum KORVEL_GUARDED_BY(m_Lock) = 0;
};

TEST(Lock, ExcludesAndNests) {
    Account account;
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; i++) {
        threads.emplace_back([&] {
            for (int j = 0; j < 500; j++) account.AddTwice(5);
        });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(account.Get(), 4 * 500 * 2 * 5);
}

}  // namespace
}  // namespace Korvel::Platform

#include "Platform/Events.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <thread>
#include <vector>

#include "Platform/Mutex.h"
#include "Platform/Time.h"

namespace Korvel::Platform {
namespace {

constexpr unsigned kLong = 20000;  // only ever reached by a failure

TEST(Events, SignalsByKindAndState) {
    // a auto-reset, m manual-reset, in capitals when they start set; then S set, R reset, P pulse,
    // 0 and 1 a look with what it must see
    const char* cases[] = {
        "a0SS10",    // two signals are one
        "A10",       // a look consumes the signal
        "aP0SP0S1",  // a pulse that nobody sees leaves nothing, and clears what was set
        "AR0",      "m0S111R0", "M11P0",
    };
    for (const char* c : cases) {
        _Event* event = NewEvent(strchr("mM", *c), strchr("AM", *c));
        for (const char* p = c + 1; *p; p++) {
            if (*p == 'S') SetEvent(event);
            if (*p == 'R') ResetEvent(event);
            if (*p == 'P') PulseEvent(event);
            if (*p != '0' && *p != '1') continue;
            // Looks in all forms see the same where they do not have to wait.
            unsigned timeoutMs = p[1] ? 0 : *p == '1' ? kNoTimeLimit : 1;
            EXPECT_EQ(WaitEvent(event, timeoutMs), *p == '1') << c;
        }
        DeleteEvent(event);
    }
    PulseEvent(nullptr);
    EXPECT_FALSE(WaitEvent(nullptr, kNoTimeLimit));
    DeleteEvent(nullptr);
}

TEST(Events, WaitsTakeTheirTimeOneAfterTheOther) {
    EXPECT_TRUE(WaitAllEvents(0, nullptr, 0));
    _Event* events[] = {NewEvent(false, true), NewEvent(false, false), NewEvent(false, true)};
    unsigned long long start = GetTimeCount();
    EXPECT_FALSE(WaitAllEvents(3, events, 60));
    unsigned long long tookMs = (GetTimeCount() - start) / (GetTimeFreq() / 1000);
    EXPECT_GE(tookMs + 2, 60u);
    EXPECT_LT(tookMs, 5000u);
    EXPECT_FALSE(WaitEvent(events[0], 0));  // was waited for
    EXPECT_TRUE(WaitEvent(events[2], 0));   // was not reached
    for (_Event* event : events) SetEvent(event);
    EXPECT_TRUE(WaitAllEvents(3, events, 1));
    for (_Event* event : events) DeleteEvent(event);
}

// Each signal of an auto-reset event lets one of many waiters through, and none is lost.
TEST(Events, OneWaiterPerSignal) {
    _Event *event = NewEvent(false, false), *taken = NewEvent(false, false);
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
            SetEvent(event);  // for the next one to leave
        });
    }
    for (int i = 1; i <= 4000; i++) {
        SetEvent(event);
        ASSERT_TRUE(WaitEvent(taken, kLong));
        ASSERT_EQ(takenCount, i);
    }
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
        auto wait = [&] {
            EXPECT_TRUE(WaitEvent(gate, kLong));
            if (--left == 0) DeleteEvent(gate);  // perhaps before SetEvent has returned
        };
        std::thread waiters[] = {std::thread(wait), std::thread(wait), std::thread(wait)};
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
    unsigned long long limit = GetTimeCount() + kLong / 1000 * GetTimeFreq();
    while (WaitEvent(event, 0) && GetTimeCount() < limit) continue;
    EXPECT_LT(GetTimeCount(), limit);
    isOver = true;
    other.join();
    DeleteEvent(event);
}

TEST(Mutex, NestsOnOneThread) {
    _Mutex* mutex = NewMutex(true);
    EXPECT_TRUE(ObtainMutex(mutex, 0));
    for (bool isFree : {false, false, true}) {
        std::thread([&] {
            EXPECT_EQ(ObtainMutex(mutex, 0), isFree);
            if (isFree) ReleaseMutex(mutex);
        }).join();
        if (!isFree) ReleaseMutex(mutex);
    }
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
    EXPECT_TRUE(count == 0 && section.m_Owner == 0 && section.m_Depth == 0);
    DeleteCriticalSection(&section);
}

}  // namespace
}  // namespace Korvel::Platform

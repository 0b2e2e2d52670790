#include "Platform/Thread.h"

#include <gtest/gtest.h>

#include <functional>
#include <thread>

#include "Platform/Event.h"
#include "Platform/ThreadInternal.h"
#include "core/FaultsInternal.h"

namespace Korvel::KorvelScript {
namespace {

constexpr unsigned kLong = 20000;  // only ever reached by a failure

// A body from outside, and a count of the living.
struct Worker : Thread {
    explicit Worker(std::function<void(Worker*)> body) : m_Body(std::move(body)) { s_Alive++; }
    ~Worker() override { s_Alive--; }
    int Main() override {
        auto body = m_Body;  // it may destroy the worker
        body(this);
        return -1;
    }

    Platform::_Thread* StartToDelete(bool deleteOnQuit) {
        SetDeleteOnQuit(deleteOnQuit);
        Platform::_Thread* thread = Start();
        EXPECT_NE(thread, nullptr);
        return thread;
    }

    std::function<void(Worker*)> m_Body;
    static inline std::atomic<int> s_Alive{0};
};

template <class Condition>
void Await(Condition condition) {
    while (!condition()) std::this_thread::yield();
}

TEST(Thread, RunsItsBodyOnceEachStart) {
    Event go, done;
    unsigned long long id = 0;
    Worker worker([&](Worker* self) {
        id = Platform::GetCurrentThreadID();
        EXPECT_EQ(self->GetThread(), Platform::GetCurrentThread());
        done.Signal();
        go.Wait(kLong);
    });
    EXPECT_TRUE(!worker.IsRunning() && !worker.GetThread() && !worker.KillThread());
    for (int i = 0; i < 3; i++) {
        Platform::_Thread* thread = worker.Start();
        ASSERT_TRUE(thread && worker.IsRunning());
        EXPECT_EQ(worker.GetThread(), thread);
        EXPECT_TRUE(done.Wait(kLong));
        EXPECT_EQ(Platform::GetThreadID(thread), id);
        EXPECT_EQ(worker.Start(), nullptr);
        EXPECT_TRUE(worker.Suspend() && worker.Resume());
        worker.Stop();
        go.Signal();
        Await([&] { return !worker.IsRunning() && !worker.GetThread(); });
    }
    go.Signal();
    Await([&] { return worker.Start() != nullptr; });
    EXPECT_TRUE(done.Wait(kLong));  // destroyed while it runs
}

// From before the body begins to after its end: whatever the moment, nothing is touched afterwards.
TEST(Thread, IsDestroyedAtAnyMoment) {
    struct Bare : Thread {
        int Main() override { return 0; }
    };
    for (int i = 0; i < 1000; i++) {
        Bare* thread = new Bare;
        ASSERT_NE(thread->Start(), nullptr);
        for (std::atomic<int> k{0}; k < i % 7 * 40;) k++;
        if (i % 10 == 0) Await([&] { return !thread->IsRunning(); });
        thread->Recycle();
    }
}

TEST(Thread, DestroysItselfWhenItQuits) {
    for (int i = 0; i < 200; i++) {
        Event go;
        Worker* worker = new Worker([&](Worker*) { go.Wait(kLong); });
        Platform::_Thread* thread = worker->StartToDelete(true);
        // The handle ends with the thread, but not for who waits already.
        std::thread waiter([&] { EXPECT_TRUE(Platform::WaitThread(thread, kLong)); });
        Await([&] { return thread->m_RefCount == 3; });
        go.Signal();
        waiter.join();
        Await([] { return Worker::s_Alive == 0; });
    }
}

TEST(Thread, MayBeDestroyedByItsOwnBody) {
    for (bool deleteOnQuit : {false, true}) {
        Event done;
        Worker* worker = new Worker([&](Worker* self) {
            self->Recycle();
            done.Signal();
        });
        worker->StartToDelete(deleteOnQuit);
        EXPECT_TRUE(done.Wait(kLong) && Worker::s_Alive == 0);
    }
}

TEST(Thread, AnOwnerMayBeFasterThanDeleteOnQuit) {
    for (int i = 0; i < 100; i++) {
        Event begun;
        Worker* worker = new Worker([&](Worker* self) {
            begun.Signal();
            Await([self] { return !self->GetThread(); });  // taken by the destructor that waits
        });
        worker->StartToDelete(true);
        EXPECT_TRUE(begun.Wait(kLong));
        delete worker;
        EXPECT_EQ(Worker::s_Alive, 0);
    }
}

#ifdef KORVEL_FAULTS
TEST(Thread, DoesNotStartWithoutMemory) {
    bool isStarted = false, isRestarted = false;
    for (unsigned n = 1; !isStarted; n++) {
        ASSERT_LT(n, 20u);
        Faults::FailAt(n, true);
        Worker* worker = new Worker([](Worker*) {});
        isStarted = worker && worker->Start();
        bool isRunning = isStarted || (worker && worker->IsRunning());
        Faults::Stop();
        EXPECT_EQ(isRunning, isStarted);
        isRestarted |= worker && !isStarted && worker->Start();
        delete worker;
    }
    EXPECT_TRUE(isRestarted);
}
#endif

}  // namespace
}  // namespace Korvel::KorvelScript

// What it takes to hand work from thread to thread: EventQueue beside the least that does the same.
#include <pthread.h>

#include <thread>

#include "Compare.h"
#include "Platform/EventQueue.h"
#include "Platform/Events.h"
#include "Platform/Threads.h"

namespace {

using Korvel::KorvelScript::EventQueue;
using Korvel::KorvelScript::MinListT;
using Korvel::KorvelScript::QueueNode;

// A list under a mutex with a condition variable.
class BareQueue {
public:
    void Put(QueueNode* node) {
        pthread_mutex_lock(&m_Mutex);
        m_List += node;
        pthread_cond_signal(&m_Condition);
        pthread_mutex_unlock(&m_Mutex);
    }
    QueueNode* Take() {
        pthread_mutex_lock(&m_Mutex);
        while (m_List.IsEmpty()) pthread_cond_wait(&m_Condition, &m_Mutex);
        QueueNode* node = m_List.Next(nullptr);
        m_List -= node;
        pthread_mutex_unlock(&m_Mutex);
        return node;
    }

private:
    pthread_mutex_t m_Mutex = PTHREAD_MUTEX_INITIALIZER;
    pthread_cond_t m_Condition = PTHREAD_COND_INITIALIZER;
    MinListT<QueueNode> m_List;
};

// Waits and gets until there is nothing, as every taker does.
class OurQueue : public EventQueue {
public:
    QueueNode* Take() {
        QueueNode* node;
        while (!(node = Get())) Wait(Korvel::Platform::kNoTimeLimit);
        return node;
    }
};

// Two queues with a thread between them that sends everything back, until it gets a node of type 1.
template <class Queue>
class Echo {
public:
    Echo() : m_Thread([this] { Run(); }) {}
    Echo(const Echo&) = delete;
    Echo& operator=(const Echo&) = delete;
    ~Echo() {
        QueueNode stop(1);
        m_There.Put(&stop);
        m_Thread.join();
    }

    void RoundTrip() {
        m_There.Put(&m_Node);
        benchmark::DoNotOptimize(m_Back.Take());
    }

private:
    void Run() {
        for (;;) {
            QueueNode* node = m_There.Take();
            if (node->GetType() == 1) return;
            m_Back.Put(node);
        }
    }

    QueueNode m_Node{0};
    Queue m_There;
    Queue m_Back;
    std::thread m_Thread;
};

template <class Queue>
void RoundTrip(benchmark::State& state) {
    Echo<Queue> echo;
    for (auto _ : state) echo.RoundTrip();
    state.counters["trips"] =
        benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}

// With nobody at the other end: the price of the bookkeeping alone.
template <class Queue>
void PutTake(benchmark::State& state) {
    Queue queue;
    QueueNode node(0);
    for (auto _ : state) {
        queue.Put(&node);
        benchmark::DoNotOptimize(queue.Take());
    }
}

void StartAndWait(benchmark::State& state) {
    using namespace Korvel::Platform;
    for (auto _ : state) {
        _Thread* thread = NewThread([](void*) { return 0ull; }, nullptr, 0, nullptr);
        WaitThread(thread, kNoTimeLimit);
        DeleteThread(thread);
    }
}

void BareStartAndWait(benchmark::State& state) {
    for (auto _ : state) {
        pthread_t thread;
        pthread_create(
            &thread, nullptr, [](void*) -> void* { return nullptr; }, nullptr);
        pthread_join(thread, nullptr);
    }
}

void Add(const char* row, void (*ours)(benchmark::State&), void (*bare)(benchmark::State&)) {
    for (bool isOurs : {true, false}) {
        std::string name = std::string(row) + (isOurs ? "@korvelscript" : "@bare pthreads");
        benchmark::RegisterBenchmark(name.c_str(), isOurs ? ours : bare)->UseRealTime();
    }
}

}  // namespace

int main(int argc, char** argv) {
    Add("queue round trip", RoundTrip<OurQueue>, RoundTrip<BareQueue>);
    Add("queue put and take", PutTake<OurQueue>, PutTake<BareQueue>);
    Add("thread start and wait", StartAndWait, BareStartAndWait);
    return Korvel::Bench::RunComparison(argc, argv);
}

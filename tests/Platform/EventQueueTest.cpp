#include "Platform/EventQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

namespace Korvel::KorvelScript {
namespace {

constexpr unsigned kLong = 20000;  // only ever reached by a failure

struct Message : QueueNode {
    Message(unsigned type, unsigned number, std::atomic<int>* alive)
        : QueueNode(type), m_Number(number), m_Alive(alive) {
        ++*m_Alive;
    }
    ~Message() override { --*m_Alive; }
    unsigned m_Number;
    std::atomic<int>* m_Alive;
};

// The sanitizer would look at the class of an object that is not there.
__attribute__((no_sanitize("vptr"))) void ReplyToNull() {
    QueueNode* volatile none = nullptr;  // volatile, for compilers warn of what they can see
    QueueNode* node = none;
    node->QueueNode::Reply();
}

TEST(EventQueue, ManyMessagesOneSignal) {
    std::atomic<int> alive{0};
    EventQueue queue;
    EXPECT_EQ(queue.Get(), nullptr);
    EXPECT_FALSE(queue.Wait(0));
    for (unsigned type = 1; type <= 3; type++) queue.Put(new Message(type, 0, &alive));
    EXPECT_TRUE(queue.Wait(0));
    EXPECT_FALSE(queue.Wait(0));
    for (unsigned type = 1; type <= 3; type++) {
        QueueNode* node = queue.Get();
        ASSERT_NE(node, nullptr);
        EXPECT_EQ(node->GetType(), type);
        node->Reply();
        EXPECT_EQ(alive, static_cast<int>(3 - type));
    }
    EXPECT_EQ(queue.Get(), nullptr);

    queue.Put(nullptr);
    EXPECT_FALSE(queue.Wait(0));
    ReplyToNull();
}

TEST(EventQueue, LeavesQueuedNodesAlone) {
    QueueNode node(1);
    { EventQueue().Put(&node); }
    EXPECT_EQ(node.GetType(), 1u);
}

// Several senders and takers: nothing is lost or doubled, and each sender's order holds.
TEST(EventQueue, KeepsEverySendersOrder) {
    constexpr unsigned kSenders = 3, kTakers = 2, kMessages = 5000;
    std::atomic<int> alive{0};
    EventQueue queue;
    std::atomic<unsigned> taken{0};
    std::vector<std::thread> threads;
    std::atomic<uint64_t> sum{0};
    for (unsigned i = 0; i < kTakers; i++) {
        threads.emplace_back([&] {
            unsigned next[kSenders] = {};
            while (taken < kSenders * kMessages) {
                queue.Wait(10);
                while (auto* message = static_cast<Message*>(queue.Get())) {
                    EXPECT_GE(message->m_Number, next[message->GetType()]);
                    next[message->GetType()] = message->m_Number + 1;
                    sum += message->m_Number;
                    taken++;
                    message->Reply();
                }
            }
        });
    }
    for (unsigned i = 0; i < kSenders; i++) {
        threads.emplace_back([&, i] {
            for (unsigned n = 0; n < kMessages; n++) queue.Put(new Message(i, n, &alive));
        });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(taken, kSenders * kMessages);
    EXPECT_EQ(sum, uint64_t{kSenders} * kMessages * (kMessages - 1) / 2);
    EXPECT_EQ(alive, 0);
}

// A message that goes to and fro: each side sleeps without a limit, so a lost wake-up would hang.
TEST(EventQueue, HandsOffWithoutLosingAWakeUp) {
    constexpr int kRounds = 5000;
    EventQueue there, back;
    QueueNode node(1);
    std::thread other([&] {
        for (int i = 0; i < kRounds; i++) {
            QueueNode* got;
            while (!(got = there.Get())) there.Wait(0xFFFFFFFF);
            back.Put(got);
        }
    });
    for (int i = 0; i < kRounds; i++) {
        there.Put(&node);
        QueueNode* got;
        while (!(got = back.Get())) ASSERT_TRUE(back.Wait(kLong));
        ASSERT_EQ(got, &node);
    }
    other.join();
}

}  // namespace
}  // namespace Korvel::KorvelScript

#include "Platform/EventQueue.h"

#include <gtest/gtest.h>

#include <set>
#include <thread>

namespace Korvel::KorvelScript {
namespace {

constexpr unsigned kLong = 20000;  // only ever reached by a failure

// A message that goes back to its sender.
struct Message : QueueNode {
    Message(unsigned type, EventQueue* back) : QueueNode(type), m_Back(back) {}
    void Reply() override { m_Back->Put(this); }
    EventQueue* m_Back;
};

// The sanitizer would look at the class of an object that is not there.
__attribute__((no_sanitize("vptr"))) void ReplyToNull() {
    QueueNode* volatile none = nullptr;  // volatile, for compilers warn of what they can see
    QueueNode* node = none;
    node->QueueNode::Reply();
}

TEST(EventQueue, ManyMessagesOneSignal) {
    QueueNode nodes[] = {QueueNode(0), QueueNode(1), QueueNode(2)};
    {
        EventQueue queue;
        queue.Put(nullptr);
        EXPECT_FALSE(queue.Wait(0));
        for (QueueNode& node : nodes) queue.Put(&node);
        EXPECT_TRUE(queue.Wait(0));
        EXPECT_FALSE(queue.Wait(0));
        for (QueueNode& node : nodes) EXPECT_EQ(queue.Get(), &node);
        EXPECT_EQ(queue.Get(), nullptr);
        queue.Put(new QueueNode(3));
        queue.Get()->Reply();  // the search for leaks sees if it were not deleted
        queue.Put(&nodes[2]);
    }
    EXPECT_EQ(nodes[2].GetType(), 2u);  // what is still queued is left alone
    ReplyToNull();
}

QueueNode* Take(EventQueue& queue) {
    for (;;) {
        QueueNode* node = queue.Get();
        if (node || !queue.Wait(kLong)) return node;
    }
}

// Nothing is lost or doubled, each sender's order holds, and no wake-up is lost: with all senders
// waiting for their answers nothing else would wake a taker.
TEST(EventQueue, SendersAndTakers) {
    constexpr unsigned kSenders = 3, kEachSends = 3 * 1500;
    EventQueue queue;
    auto take = [&] {
        unsigned next[kSenders] = {};
        for (;;) {
            QueueNode* node = Take(queue);
            ASSERT_NE(node, nullptr);
            unsigned sender = node->GetType() / kEachSends, number = node->GetType() % kEachSends;
            if (sender == kSenders) {
                queue.Put(node);  // the end, for the other taker, too
                return;
            }
            EXPECT_GE(number, next[sender]);
            next[sender] = number + 1;
            node->Reply();
        }
    };
    auto send = [&](unsigned self) {
        for (unsigned type = self * kEachSends; type < (self + 1) * kEachSends; type += 3) {
            EventQueue back;  // ends as soon as the last answer is here
            Message messages[] = {{type, &back}, {type + 1, &back}, {type + 2, &back}};
            for (Message& message : messages) queue.Put(&message);
            std::set<QueueNode*> answers{Take(back), Take(back), Take(back)};
            ASSERT_EQ(answers, (std::set<QueueNode*>{messages, messages + 1, messages + 2}));
        }
    };
    std::thread takers[] = {std::thread(take), std::thread(take)};
    std::thread senders[] = {std::thread(send, 0), std::thread(send, 1), std::thread(send, 2)};
    for (std::thread& sender : senders) sender.join();
    QueueNode end(kSenders * kEachSends);
    queue.Put(&end);
    for (std::thread& taker : takers) taker.join();
    EXPECT_EQ(queue.Get(), &end);
    EXPECT_EQ(queue.Get(), nullptr);
}

}  // namespace
}  // namespace Korvel::KorvelScript

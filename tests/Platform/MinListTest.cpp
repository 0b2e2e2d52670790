#include "Platform/MinList.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <vector>

namespace Korvel::KorvelScript {
namespace {

struct Payload {
    virtual ~Payload() = default;
};

std::vector<int> s_Died;

// The links are not at the front, so every conversion between node and item moves the pointer.
struct Item : Payload, MinNode {
    explicit Item(int number) : m_Number(number) {}
    ~Item() override { s_Died.push_back(m_Number); }
    int m_Number;
};

std::vector<Item*> Walk(const MinListT<Item>& list) {
    std::vector<Item*> there, back;
    for (Item* item : list) there.push_back(item);
    for (Item* i = list.Prev(nullptr); i; i = list.Prev(i)) back.insert(back.begin(), i);
    EXPECT_EQ(there, back);
    EXPECT_EQ(list.IsEmpty(), there.empty());
    return there;
}

TEST(MinList, FollowsAModelThroughRandomChanges) {
    std::mt19937 random(7);
    std::vector<Item*> items, models[2];
    for (int i = 0; i < 24; i++) items.push_back(new Item(i));
    MinListT<Item> lists[2];
    for (int step = 0; step < 4000; step++) {
        Item* item = items[random() % items.size()];
        unsigned at = random() % 2;
        if (std::erase(models[0], item) + std::erase(models[1], item)) {
            lists[at] -= item;  // whichever list it is asked of
        } else {
            lists[at] += item;
            models[at].push_back(item);
        }
        if (step % 100 == 99) {
            lists[at].Clear(false);
            models[at].clear();
        }
        for (int i = 0; i < 2; i++) ASSERT_EQ(Walk(lists[i]), models[i]);
    }
    EXPECT_TRUE(s_Died.empty());

    for (auto& list : lists) list.Clear(false);
    for (Item* item : items) lists[0] += item;
    lists[0].Clear(true);
    EXPECT_TRUE(Walk(lists[0]).empty());
    EXPECT_EQ(s_Died.size(), items.size());
    EXPECT_TRUE(std::is_sorted(s_Died.begin(), s_Died.end()));  // front to back
}

}  // namespace
}  // namespace Korvel::KorvelScript

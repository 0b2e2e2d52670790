#include "Platform/MinList.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <memory>
#include <random>
#include <vector>

namespace Korvel::KorvelScript {
namespace {

struct Payload {
    virtual ~Payload() = default;
    int m_Number = 0;
};

// The links are not at the front, so every conversion between node and item moves the pointer.
struct Item : Payload, MinNode {
    explicit Item(int number, std::vector<int>* died = nullptr) : m_Died(died) {
        m_Number = number;
    }
    ~Item() override {
        if (m_Died) m_Died->push_back(m_Number);
    }
    std::vector<int>* m_Died;
};

using List = MinListT<Item>;

std::vector<Item*> Forward(const List& list) {
    std::vector<Item*> items;
    for (Item* item : list) items.push_back(item);
    return items;
}

std::vector<Item*> Backward(const List& list) {
    std::vector<Item*> items;
    for (Item* item = list.Prev(nullptr); item; item = list.Prev(item)) items.push_back(item);
    std::reverse(items.begin(), items.end());
    return items;
}

TEST(MinList, FollowsAModelThroughRandomChanges) {
    std::mt19937 random(7);
    std::vector<std::unique_ptr<Item>> items;
    for (int i = 0; i < 24; i++) items.push_back(std::make_unique<Item>(i));
    List lists[2];
    std::vector<Item*> models[2];
    std::vector<int> home(items.size(), -1);
    for (int step = 0; step < 4000; step++) {
        Item* item = items[random() % items.size()].get();
        int& at = home[static_cast<size_t>(item->m_Number)];
        if (at < 0) {
            at = static_cast<int>(random() % 2);
            lists[at] += item;
            models[at].push_back(item);
        } else {
            lists[random() % 2] -= item;  // whichever list it is asked of
            std::erase(models[at], item);
            at = -1;
        }
        for (int i = 0; i < 2; i++) {
            ASSERT_EQ(Forward(lists[i]), models[i]);
            ASSERT_EQ(Backward(lists[i]), models[i]);
            ASSERT_EQ(lists[i].IsEmpty(), models[i].empty());
        }
    }
}

TEST(MinList, ClearUnlinksAndDeletesFrontToBack) {
    std::vector<int> died;
    List list;
    Item kept(1, &died);
    Item alsoKept(2, &died);
    list += &kept;
    list += &alsoKept;
    list.Clear(false);
    EXPECT_TRUE(list.IsEmpty());
    EXPECT_TRUE(died.empty());

    list += &alsoKept;  // unlinked nodes can go onto a list again, in another order
    list += &kept;
    EXPECT_EQ(Forward(list), (std::vector<Item*>{&alsoKept, &kept}));
    list.Clear(false);

    for (int i = 3; i < 6; i++) list += new Item(i, &died);
    list.Clear(true);
    EXPECT_EQ(died, (std::vector<int>{3, 4, 5}));
    EXPECT_EQ(list.Next(nullptr), nullptr);
    EXPECT_EQ(list.Prev(nullptr), nullptr);
}

}  // namespace
}  // namespace Korvel::KorvelScript

#include "core/RefObject.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "core/ScriptVal.h"
#include "core/SpinLock.h"
#include "core/TagList.h"

namespace Korvel {
namespace {

template <class Base>
struct Counted : Base {
    Counted() { s_Alive++; }
    Counted(const Counted& other) : Base(other) { s_Alive++; }
    Counted& operator=(const Counted&) = default;
    ~Counted() override { s_Alive--; }
    static inline std::atomic<int> s_Alive{0};
};

template <class T>
class UseCounts : public testing::Test {};
using Bases = testing::Types<Counted<RefObject>, Counted<RefCount>>;
TYPED_TEST_SUITE(UseCounts, Bases);

TYPED_TEST(UseCounts, TheLastRecycleDestroys) {
    using T = TypeParam;
    T* object = new T;
    object->Use();
    T* copy = new T(*object);
    *copy = *object;
    EXPECT_TRUE(object->GetUseCount() == 2 && copy->GetUseCount() == 1);
    copy->Recycle();
    EXPECT_EQ(T::s_Alive, 1);
    {
        ptr<T> held(object), shared = ptr<T>::Share(object), moved(std::move(held));
        shared = moved;
        shared = ptr<T>();
        EXPECT_TRUE(!held && !shared && moved->GetUseCount() == 2);
        held = ptr<T>::Share(nullptr);
        EXPECT_EQ(held.Release(), nullptr);
    }
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; i++) {
        object->Use();
        threads.emplace_back([object] {
            for (int k = 0; k < 1000; k++) ptr<T>::Share(object);
            object->Recycle();
        });
    }
    object->Recycle();
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(T::s_Alive, 0);
}

// The sanitizer would look for the object's type.
template <class T>
__attribute__((no_sanitize("vptr"))) void CountNull() {
    const T* volatile object = nullptr;  // volatile, or the compiler sees through the calls
    object->T::Use();
    object->T::Recycle();
}

TEST(RefObject, NullIsNotCounted) {
    CountNull<RefObject>();
    CountNull<RefCount>();
}

TEST(RefObject, StartsWithTheUsesThatTheHostSets) {
    SetInitUseCount(3);
    RefObject object, copy(object);
    SetInitUseCount(1);
    EXPECT_TRUE(GetInitUseCount() == 1 && object.GetUseCount() == 3 && copy.GetUseCount() == 3);
    copy.OnAddToList(nullptr, nullptr, nullptr);
    copy.OnRemoveFromList(nullptr, nullptr, nullptr);
    copy.OnRemoveFromList(nullptr, nullptr, nullptr);
    copy = object;
    EXPECT_EQ(copy.GetUseCount(), 2);
}

struct WithAttributes : RefObject {
    bool CopyAttr(unsigned long long tag, void* out) const override {
        unsigned long long type = TypeOfTag(tag);
        if (type == TAG_INT) *static_cast<uint32_t*>(out) = 0x80000000;
        if (type == TAG_DOUBLE) *static_cast<double*>(out) = 0.5;
        if (type == TAG_PTR) *static_cast<void**>(out) = out;
        if (type == TAG_ID) *static_cast<OxID*>(out) = OxID("copied", true);
        return type != TAG_CONTROL;
    }
};

TEST(RefObject, TellsItsAttributesAndUses) {
    WithAttributes object;
    EXPECT_EQ(object.GetAttr(TAG_INT | 1), 0x80000000);
    EXPECT_EQ(object.GetAttrD(TAG_DOUBLE | 2, 9), 0.5);
    EXPECT_NE(object.GetAttrPtr(TAG_PTR | 3), nullptr);
    EXPECT_TRUE(object.GetAttrB(TAG_INT | 1) && object.GetAttrID(TAG_ID | 4) == "copied");
    // A tag of another type than is asked for: more than 32 bits, and identifiers, do no harm.
    EXPECT_TRUE(object.GetAttrB(TAG_PTR | 3));
    EXPECT_TRUE(object.GetAttr(TAG_ID | 4, 7) == 7 && object.GetAttrID(TAG_INT | 1, "x") == "x");
    EXPECT_EQ(object.GetAttr(9) + object.GetAttr(9, 7), 7u);
    EXPECT_EQ(object.GetAttrD(9) + object.GetAttrD(9, 7), 7);
    EXPECT_TRUE(!object.GetAttrPtr(9) && object.GetAttrPtr(9, &object) == &object);
    EXPECT_TRUE(!object.GetAttrB(9) && object.GetAttrB(9, true));
    EXPECT_TRUE(!object.GetAttrID(9).IsValid() && object.GetAttrID(9, "def") == "def");

    ScriptVal all("*"), result(SV_Table, nullptr);
    object.Use();
    object.GetObjectInfo(all, result);
    EXPECT_TRUE(result["UseCount"] == 2);
}

TEST(NestedSpinLock, LetsItsHolderInAgain) {
    static constinit NestedSpinLock s_Lock;
    int count = 0;
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; t++) {
        threads.emplace_back([&] {
            for (int i = 0; i < 2000; i++) {
                AutoNestedSpinLock outer(s_Lock);
                int seen = count;
                {
                    AutoNestedSpinLock inner(s_Lock);
                    if (i % 500 == 0) std::this_thread::yield();
                }
                count = seen + 1;
            }
        });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(count, 8000);
}

}  // namespace
}  // namespace Korvel

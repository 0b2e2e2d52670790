#include "objects/ObjectReferences.h"

#include <gtest/gtest.h>

#include <atomic>
#include <map>
#include <memory>
#include <new>
#include <random>
#include <thread>
#include <utility>
#include <vector>

#include "core/FaultsInternal.h"
#include "core/RefObject.h"
#include "core/ScriptHooksInternal.h"
#include "core/ScriptVal.h"

namespace {

using namespace Korvel;
using Refs = ObjectReferences;

// A place where one object after the other stands.
class Place {
public:
    Place() = default;
    Place(const Place&) = delete;
    Place& operator=(const Place&) = delete;
    ~Place() { Destroy(); }

    void Build() { m_Object = new (m_Memory) _Object; }
    void Destroy() {
        if (m_Object) m_Object->~_Object();
        m_Object = nullptr;
    }
    _Object* Address() { return reinterpret_cast<_Object*>(m_Memory); }

    _Object* m_Object = nullptr;

private:
    alignas(_Object) unsigned char m_Memory[sizeof(_Object)];
};

TEST(ObjectReferences, ADeadObjectIsNeverMistakenForItsSuccessor) {
    Place place;
    place.Build();
    EXPECT_EQ(Refs::GetObjectReference(place.m_Object), 0u);
    uint64_t first = Refs::AddObjectReference(place.m_Object);
    EXPECT_GE(first, 1u);
    EXPECT_EQ(Refs::AddObjectReference(place.m_Object), first);
    EXPECT_EQ(Refs::GetReferenceObject(first), place.m_Object);
    EXPECT_EQ(Refs::GetObjectReference(std::make_unique<_Object>(*place.m_Object).get()), 0u);
    ScriptVal value(place.m_Object);
    EXPECT_EQ(value.ToLocalObject(), place.m_Object);

    place.Destroy();
    EXPECT_EQ(Refs::GetObjectReference(place.Address()), 0u);
    EXPECT_EQ(Refs::GetReferenceObject(first), nullptr);
    place.Build();
    EXPECT_EQ(value.ToLocalObject(), nullptr);  // before the new one has a number, and after
    EXPECT_GT(Refs::AddObjectReference(place.m_Object), first);
    EXPECT_EQ(value.ToLocalObject(), nullptr);
    EXPECT_EQ(Refs::GetReferenceObject(first), nullptr);

    EXPECT_EQ(Refs::AddObjectReference(nullptr) + Refs::GetObjectReference(nullptr), 0u);
    EXPECT_FALSE(Refs::GetReferenceObject(0) || Refs::ClearObjectReferences(nullptr, true));
}

TEST(ObjectReferences, ClearingTellsTheTablesOfExports) {
    static int s_Calls = 0;
    ScriptHooks hooks = g_ScriptHooks;
    g_ScriptHooks.m_ForgetExports = [](ScriptObject*, bool dropCounts) {
        s_Calls++;
        return dropCounts;
    };
    {
        _Object object, untouched;
        uint64_t ref = Refs::AddObjectReference(&object);
        EXPECT_TRUE(Refs::ClearObjectReferences(&object, true));
        EXPECT_EQ(Refs::GetReferenceObject(ref), nullptr);
        EXPECT_FALSE(Refs::ClearObjectReferences(&object, false));
        EXPECT_GT(Refs::AddObjectReference(&object), ref);
    }
    EXPECT_EQ(s_Calls, 3);  // the last by the destructor; none for the other object
    g_ScriptHooks = hooks;
}

TEST(ObjectReferences, AgreesWithAModel) {
    std::mt19937 random(7);
    std::vector<std::unique_ptr<_Object>> objects(3000);
    std::map<uint64_t, _Object*> model;  // null for the dead
    for (int step = 0; step < 30000; step++) {
        auto& object = objects[random() % objects.size()];
        if (!object) {
            object = std::make_unique<_Object>();
            uint64_t ref = Refs::AddObjectReference(object.get());
            ASSERT_TRUE(model.empty() || ref > model.rbegin()->first);
            model[ref] = object.get();
        } else if (random() % 3 == 0) {
            _Object*& known = model[Refs::GetObjectReference(object.get())];
            ASSERT_EQ(std::exchange(known, nullptr), object.get());
            object.reset();
        }
    }
    for (const auto& [ref, object] : model) {
        EXPECT_EQ(Refs::GetReferenceObject(ref), object);
        EXPECT_EQ(Refs::GetObjectReference(object), object ? ref : 0);
    }
}

// One thread builds and destroys at one place, and all hold values on what stood there once.
TEST(ObjectReferences, StaleValuesReachNobodyOnAnyThread) {
    constexpr int kThreads = 8;
    Place places[kThreads];
    std::atomic<uint64_t> refs[kThreads]{};
    auto run = [&](unsigned t) {
        std::mt19937 random(t);
        Place& mine = places[t];
        for (int step = 0; step < 2000; step++) {
            mine.Build();
            uint64_t ref = refs[t] = Refs::AddObjectReference(mine.m_Object);
            ScriptVal value(mine.m_Object);
            EXPECT_EQ(value.ToLocalObject(), mine.m_Object);
            ScriptObject* found = Refs::GetReferenceObject(refs[random() % kThreads]);
            bool isAPlace = found == nullptr;
            for (Place& place : places) isAPlace |= place.Address() == found;
            EXPECT_TRUE(isAPlace);
            mine.Destroy();
            EXPECT_FALSE(Refs::GetReferenceObject(ref) || value.ToLocalObject());
            EXPECT_TRUE(value.CallMember("Any").IsNil());
        }
    };
    std::vector<std::thread> threads;
    for (unsigned t = 0; t < kThreads; t++) threads.emplace_back(run, t);
    for (std::thread& thread : threads) thread.join();
}

TEST(ObjectReferences, TwoThreadsGetOneNumber) {
    std::vector<_Object> objects(2000);
    std::vector<uint64_t> seen[2];
    std::atomic<size_t> begun{0};
    auto run = [&](int t) {
        for (_Object& object : objects) {
            begun++;
            for (int spins = 0; begun < 2 * (seen[t].size() + 1); spins++) {
                if (spins > 1000) std::this_thread::yield();
            }
            seen[t].push_back(Refs::AddObjectReference(&object));
        }
    };
    std::thread other(run, 1);
    run(0);
    other.join();
    EXPECT_EQ(seen[0], seen[1]);
}

#ifdef KORVEL_FAULTS
TEST(ObjectReferences, WithoutMemoryThereIsNoNumber) {
    std::vector<_Object> objects(2000);
    unsigned without = 0;
    for (size_t i = 0; i < objects.size(); i++) {
        // Now and then for good, so that the tables cannot grow either.
        if (i % 3) Faults::FailAt(i % 5 == 0 ? 2 : 1, true);
        uint64_t ref = Refs::AddObjectReference(&objects[i]);
        if (i % 3) Faults::Stop();
        without += ref == 0;
        EXPECT_EQ(Refs::GetObjectReference(&objects[i]), ref);
        EXPECT_EQ(Refs::GetReferenceObject(ref), ref ? &objects[i] : nullptr);
    }
    EXPECT_GT(without, 500u);
    for (_Object& object : objects) EXPECT_NE(Refs::AddObjectReference(&object), 0u);
}
#endif

}  // namespace

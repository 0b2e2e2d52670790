#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <new>
#include <random>
#include <thread>
#include <utility>
#include <vector>

#include "core/FaultsInternal.h"
#include "core/RefObject.h"
#include "objects/ScriptConfig.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"

namespace Korvel {
namespace {

// A connection whose packets are only noted.
class TestApp : public RemoteApp {
public:
    TestApp() : RemoteApp("test", 0, nullptr) {}
    bool Connected() const override { return m_IsOpen; }
    uint32_t DoPktAsync(Packet* packet, AsyncCallback, void*) override {
        std::lock_guard guard(m_SentLock);
        if (packet->m_Type == PKT_NoMoreRefs) m_Sent.push_back(packet->m_Target);
        FreePkt(packet);
        return 1;
    }
    void Disconnect() override { m_NumEnds++; }
    void Start() {
        InitReferences();
        HoldRoot();
    }
    void End() {
        m_IsOpen = false;
        Cleanup(GetRun());
    }

    using RemoteApp::DropLocalRefs;
    using RemoteApp::ExportAddress;

    std::atomic<bool> m_IsOpen{true};
    std::mutex m_SentLock;
    std::vector<uint32_t> m_Sent;  // numbers that were released
    std::atomic<int> m_NumEnds{0};
};

// An object that lives as long as it is counted; it starts with one count.
class Thing : public _Object {
public:
    Thing() { s_NumAlive++; }
    ~Thing() override { s_NumAlive--; }
    void IncRef() override {
        m_Count++;
        if (m_OnCount) m_OnCount();
    }
    void DecRef() override {
        if (m_OnCount) m_OnCount();
        if (--m_Count == 0) delete this;
    }
    std::atomic<int> m_Count{1};
    std::function<void()> m_OnCount;
    static inline std::atomic<int> s_NumAlive{0};
};

// Installs a configuration with an application object.
class Root {
public:
    explicit Root(ScriptObject* object) {
        s_Object = object;
        m_Config.GetApp = [](void*, TagList*) { return s_Object; };
        g_ScriptConfig = &m_Config;
    }
    ~Root() { g_ScriptConfig = nullptr; }
    static inline ScriptObject* s_Object;

private:
    ScriptConfig m_Config;
};

TEST(References, AnObjectIsHeldOnceForEachConnection) {
    Thing* thing = new Thing;
    TestApp first, second;
    first.Start();
    uint32_t id = first._IncLocalRef(thing)->m_ID;
    for (int i = 0; i < 2; i++) EXPECT_EQ(first._IncLocalRef(thing)->m_ID, id);
    EXPECT_EQ(first.FindLocalObject(id)->m_Count, 3u);
    thing->DecRef();
    EXPECT_EQ(second.FindLocalObject(id), nullptr) << "not given to that peer";
    EXPECT_EQ(second._IncLocalRef(thing)->m_ID, id);
    EXPECT_EQ(thing->m_Count, 3);
    EXPECT_TRUE(first.DropLocalRefs(id));
    EXPECT_EQ(first.m_NumEnds, 1) << "nothing is held in either direction";
    EXPECT_EQ(second.HoldLocalObject(id), thing) << "the other connection has its own";
    EXPECT_TRUE(second._DecLocalRef(thing));
    EXPECT_GT(first._IncLocalRef(thing)->m_ID, id);
    thing->DecRef();
    for (uint64_t wrong : {0ull, 99999999ull, (1ull << 32) + id}) {
        EXPECT_FALSE(first.FindLocalObject(wrong) || first.DropLocalRefs(wrong)) << wrong;
    }
    EXPECT_FALSE(first._IncLocalRef(nullptr) || first._DecLocalRef(nullptr));
    first.End();
    EXPECT_EQ(thing->m_Count, 1);
    thing->DecRef();
    EXPECT_EQ(Thing::s_NumAlive, 0);
}

TEST(References, TheLastProxySendsOneRelease) {
    TestApp app;
    EXPECT_TRUE(app.FindRemoteObject(99).IsNil());
    EXPECT_FALSE(app.IncRemoteRef(0) || app.IncRemoteRef(1ull << 32));
    {
        ScriptVal root = app.FindRemoteObject(1);
        ScriptVal copy = root, again = app.FindRemoteObject(1);
        EXPECT_TRUE(root == again && copy.GetApp() == &app && copy.IsValidRemoteObject());
        EXPECT_EQ(root.ToRemoteObject()->m_Count, 3u);
        app._IncLocalRef(Root::s_Object = new Thing);
    }
    EXPECT_EQ(app.m_Sent, std::vector<uint32_t>{1});
    EXPECT_EQ(app.m_NumEnds, 0) << "the peer holds something";
    EXPECT_TRUE(app.FindRemoteObject(1).IsNil()) << "gone like any other";

    RemoteObject* unnamed = app.IncRemoteRef(UINT32_MAX);
    EXPECT_EQ(app.IncRemoteRef(UINT32_MAX), unnamed);
    unnamed->DecRef();
    app.m_IsOpen = false;
    unnamed->DecRef();
    app.DecRemoteRef(UINT32_MAX);
    EXPECT_EQ(app.m_Sent.size(), 1u) << "nothing is sent when closed";
    EXPECT_EQ(app.GetUseCount(), 2u);
    RemoteObject lone{};
    lone.IncRef();
    lone.DecRef();
    app.Cleanup(app.GetRun());
    static_cast<Thing*>(Root::s_Object)->DecRef();
    EXPECT_EQ(app.GetUseCount(), 1u);
}

TEST(References, NumberOneIsTheApplicationInEachRun) {
    Thing* thing = new Thing;
    Root root(thing);
    TestApp app, other;
    EXPECT_EQ(app.HoldLocalObject(1), thing) << "before anything has been sent";
    app.Start();
    EXPECT_EQ(app._IncLocalRef(thing)->m_ID, 1u);
    EXPECT_EQ(thing->m_Count, 4) << "ours, what the search holds, and one for each connection";
    EXPECT_TRUE(app.DropLocalRefs(1));
    EXPECT_FALSE(app.FindLocalObject(1));
    EXPECT_EQ(app.m_NumEnds, 1);
    app.End();

    alignas(Thing) unsigned char place[sizeof(Thing)];
    Thing* next = new (place) Thing;
    Root::s_Object = next;
    app.m_IsOpen = true;
    app.Start();
    EXPECT_EQ(app.HoldLocalObject(1), next);
    EXPECT_EQ(other.HoldLocalObject(1), thing);
    next->~Thing();
    EXPECT_FALSE(app.FindLocalObject(1)) << "it has died";
    next = new (place) Thing;
    TestApp third;
    EXPECT_FALSE(app.FindLocalObject(1)) << "another one has its number and its place";
    uint32_t id = app._IncLocalRef(next)->m_ID;
    EXPECT_GT(id, 1u);
    EXPECT_TRUE(app.DropLocalRefs(id));
    Root::s_Object = nullptr;
    app.End();
    third.End();
    EXPECT_EQ(next->m_Count, 1);
    next->~Thing();
    app.m_IsOpen = true;
    app.Start();
    EXPECT_FALSE(app.HoldLocalObject(1));
    EXPECT_TRUE(app.DropLocalRefs(1)) << "an entry without an object";
    other.End();
    EXPECT_EQ(thing->m_Count, 3);
    for (int i = 0; i < 3; i++) thing->DecRef();
    EXPECT_EQ(app.GetUseCount(), 1u);
}

TEST(References, ADeadObjectIsFoundNoMore) {
    alignas(_Object) unsigned char place[sizeof(_Object)];
    TestApp app, other;
    app.Start();
    auto* object = new (place) _Object;
    uint32_t stale = app._IncLocalRef(object)->m_ID;
    app._IncLocalRef(object);
    object->~_Object();
    EXPECT_FALSE(app.FindLocalObject(stale) || RemoteApp::GetObjectPtr(stale));
    EXPECT_FALSE(app.ExportAddress(reinterpret_cast<uintptr_t>(place)));
    EXPECT_FALSE(app.ExportAddress(reinterpret_cast<uintptr_t>(&app)) || app.ExportAddress(0));

    object = new (place) _Object;
    ScriptVal seen(object);
    uint32_t id = app.ExportAddress(reinterpret_cast<uintptr_t>(place));
    EXPECT_GT(id, stale);
    EXPECT_TRUE(app._DecLocalRef(object)) << "the living one comes first";
    EXPECT_FALSE(app.FindLocalObject(id));
    EXPECT_FALSE(app._DecLocalRef(object)) << "the dead one's";
    EXPECT_EQ(app.GetUseCount(), 2u);
    EXPECT_FALSE(app.DropLocalRefs(stale)) << "an error for the peer, and yet its entry goes";
    EXPECT_EQ(app.GetUseCount(), 1u);
    EXPECT_EQ(app.m_NumEnds, 1);
    object->~_Object();

    Thing* thing = new Thing;  // one that is taken back while it lives
    app._IncLocalRef(thing);
    other._IncLocalRef(thing);
    EXPECT_EQ(thing->m_Count, 3);
    EXPECT_TRUE(RemoteApp::ClearObjectReferences(thing, true));
    EXPECT_EQ(thing->m_Count, 1);
    EXPECT_FALSE(RemoteApp::ClearObjectReferences(thing, true));
    app.End();
    other.End();
    EXPECT_EQ(thing->m_Count, 1);
    thing->DecRef();
}

TEST(References, ObjectsAreCountedWithoutLocks) {
    TestApp app;
    Thing* thing = new Thing;
    int numCounted = 0;
    thing->m_OnCount = [&] {
        numCounted++;
        std::thread([&] {
            ASSERT_TRUE(app.GetLock().TryObtainLock());
            app.GetLock().ReleaseLock();
            RemoteApp::GetObjectPtr(1);
        }).join();
    };
    uint32_t id = app._IncLocalRef(thing)->m_ID;
    EXPECT_EQ(app.HoldLocalObject(id), thing);
    EXPECT_EQ(numCounted, 2);
    thing->DecRef();
    EXPECT_TRUE(app.DropLocalRefs(id));

    {  // in packets: it goes out, and comes home as the peer's proxy of it
        ScriptVal value(thing), proxy;
        Packet* packet = CreatePkt(PKT_Script, &app, &value, nullptr);
        memcpy(&id, packet->Payload() + 4, sizeof id);
        RemoteObject* record = app.IncRemoteRef(id);
        proxy.Set(SV_RemoteObject, &record);
        record->DecRef();
        FreePkt(std::exchange(packet, CreatePkt(PKT_Script, &app, nullptr, &proxy)));
        numCounted = 0;
        EXPECT_TRUE(ScriptVal::FromPacket(&app, packet, nullptr, &value));
        EXPECT_EQ(value.ToLocalObject(), thing);
        EXPECT_EQ(numCounted, 2) << "one more, and the old one less";
        FreePkt(packet);
    }

    // The peer lets go, or the connection ends, while the object is being counted for a call.
    for (bool isEnd : {false, true}) {
        id = app._IncLocalRef(thing)->m_ID;
        bool isArmed = true;
        thing->m_OnCount = [&] {
            if (!std::exchange(isArmed, false)) return;
            EXPECT_EQ(thing->m_Count, 3);
            if (isEnd) {
                app.End();
            } else {
                EXPECT_TRUE(app.DropLocalRefs(id));
            }
            EXPECT_FALSE(app.FindLocalObject(id) || app._DecLocalRef(thing));
            EXPECT_EQ(thing->m_Count, 3) << "the entry keeps it until it has been counted";
        };
        EXPECT_EQ(app.HoldLocalObject(id), thing);
        thing->m_OnCount = nullptr;
        EXPECT_EQ(thing->m_Count, 2);
        EXPECT_EQ(RemoteApp::GetObjectPtr(id), nullptr);
        thing->DecRef();
    }
    EXPECT_EQ(app.GetUseCount(), 1u);
    thing->DecRef();
    EXPECT_EQ(Thing::s_NumAlive, 0);
}

TEST(References, CountsStayAtTheirEnd) {
    TestApp app;
    Thing* thing = new Thing;
    RemoteObject* records[] = {app._IncLocalRef(thing), app.IncRemoteRef(5)};
    for (RemoteObject* record : records) {
        record->m_Count = UINT32_MAX - 1;
        for (int i = 0; i < 2; i++) record->IncRef();
        for (int i = 0; i < 3; i++) record->DecRef();
        EXPECT_EQ(record->m_Count, UINT32_MAX);
    }
    records[1]->m_Count = 1;
    records[1]->DecRef();
    EXPECT_TRUE(app.DropLocalRefs(records[0]->m_ID));
    EXPECT_EQ(thing->m_Count, 1);
    thing->DecRef();
}

// The n-th allocation fails, and all that follow; in the last round none does.
TEST(References, TheEndGivesAllBack) {
    bool isDone = false;
    for (unsigned n = 1; !isDone; n++) {
        TestApp app;
        std::vector<Thing*> things(100);
        for (Thing*& thing : things) thing = new Thing;
        Faults::FailAt(n, true);
        for (Thing* thing : things) {
            EXPECT_EQ(app._IncLocalRef(thing) ? 2 : 1, thing->m_Count);
            if (RemoteObject* proxy = app.IncRemoteRef(n + 1)) proxy->DecRef();
        }
        isDone = Faults::Stop() < n;
        app.Cleanup(app.GetRun());
        EXPECT_TRUE(!isDone || things[99]->m_Count == 2) << "nothing while it is connected";
        app.End();
        EXPECT_FALSE(app._IncLocalRef(things[0])) << "closed";
        for (Thing* thing : things) thing->DecRef();
        EXPECT_EQ(Thing::s_NumAlive, 0);
        EXPECT_EQ(app.GetUseCount(), 1u);
    }
}

// Random operations of two peers beside what they should amount to.
TEST(References, CountsAgreeWithAModel) {
    std::mt19937 random(20);
    constexpr int kNumObjects = 300;
    std::vector<std::unique_ptr<Thing>> things(kNumObjects);
    TestApp apps[2];
    struct Export {
        uint32_t m_ID = 0;
        uint32_t m_Count = 0;
    };
    std::map<int, Export> model[2];
    for (int step = 0; step < 30000; step++) {
        int i = static_cast<int>(random() % kNumObjects);
        int a = static_cast<int>(random() % 2);
        TestApp& app = apps[a];
        if (!things[i]) things[i] = std::make_unique<Thing>();
        Thing* thing = things[i].get();
        bool isKnown = model[a].count(i) > 0;
        Export& entry = model[a][i];
        switch (random() % 8) {
            case 0:  // dies; what it leaves behind goes with the peer's release
                things[i] = nullptr;
                for (int k : {0, 1}) {
                    EXPECT_FALSE(apps[k].DropLocalRefs(model[k][i].m_ID));
                    model[k].erase(i);
                }
                break;
            case 1:  // is released
                EXPECT_EQ(app.DropLocalRefs(entry.m_ID), isKnown);
                model[a].erase(i);
                break;
            case 2:
                EXPECT_EQ(app._DecLocalRef(thing), isKnown);
                if (!isKnown || --entry.m_Count == 0) model[a].erase(i);
                break;
            default:
                uint32_t id = app._IncLocalRef(thing)->m_ID;
                EXPECT_TRUE(!isKnown || id == entry.m_ID);
                entry = {id, entry.m_Count + 1};
                ASSERT_EQ(app.HoldLocalObject(id), thing);
                thing->DecRef();
                EXPECT_EQ(app.FindLocalObject(id)->m_Count, entry.m_Count);
                thing->DecRef();
                break;
        }
        if (things[i]) {
            int numHolders = 1 + static_cast<int>(model[0].count(i) + model[1].count(i));
            ASSERT_EQ(things[i]->m_Count, numHolders);
        }
    }
    for (int a : {0, 1}) {
        EXPECT_EQ(apps[a].GetUseCount(), 1 + model[a].size());
        apps[a].End();
        EXPECT_EQ(apps[a].GetUseCount(), 1u);
    }
}

TEST(References, ManyThreadsCountExactly) {
    TestApp app;
    std::vector<Thing*> things(8);
    for (Thing*& thing : things) thing = new Thing;
    std::vector<std::thread> threads;
    for (unsigned t = 0; t < 4; t++) {
        threads.emplace_back([&, t] {
            std::mt19937 random(t);
            for (int i = 0; i < 5000; i++) {
                Thing* thing = things[random() % things.size()];
                ScriptObject* held = app.HoldLocalObject(app._IncLocalRef(thing)->m_ID);
                EXPECT_EQ(held, thing);
                held->DecRef();
                app._DecLocalRef(thing);
                RemoteObject* proxy = app.IncRemoteRef(1 + random() % 4);
                ScriptVal value = app.FindRemoteObject(proxy->m_ID);
                proxy->DecRef();
            }
        });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(app.GetUseCount(), 1u);
    for (Thing* thing : things) thing->DecRef();
    EXPECT_EQ(Thing::s_NumAlive, 0);
}

}  // namespace
}  // namespace Korvel

// Random traffic of many threads over connections that die and are made again, beside a model of
// what must live. KORVEL_SOAK_SECONDS is the time of all variants together, and KORVEL_SOAK_SEED
// repeats a run, as far as threads can be repeated.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <mutex>
#include <random>
#include <set>
#include <thread>
#include <utility>
#include <vector>

#include "Platform/Time.h"
#include "RemoteFixture.h"

namespace Korvel {
namespace {

using namespace Test;
using Clock = std::chrono::steady_clock;
using Random = std::mt19937;

constexpr int kNumVariants = 3;
constexpr int kNumSlots = 3;
constexpr int kNumWorkers = 4;
constexpr int kNumKept = 8;
constexpr size_t kMostHeld = 24;

double GetSetting(const char* name, double standard) {
    const char* text = getenv(name);
    return text ? atof(text) : standard;
}

std::mutex s_Lock;
std::set<double> s_Alive;             // guarded by s_Lock
std::vector<ScriptVal> s_Store;       // guarded by s_Lock; given by one side, taken by any
std::atomic<bool> s_HasStore{false};  // takes no more when not
std::atomic<double> s_NextNumber{1};

// An object with a number of its own, by which the model knows it.
class Token : public Scripted<_Object> {
    KORVEL_SCRIPTED(Token)
public:
    Token() {
        SetScriptClass();
        std::lock_guard guard(s_Lock);
        s_Alive.insert(m_Number);
    }
    ~Token() override {
        std::lock_guard guard(s_Lock);
        s_Alive.erase(m_Number);
    }
    void IncRef() override { m_Count++; }
    void DecRef() override {
        if (--m_Count == 0) delete this;
    }

    const double m_Number = s_NextNumber.fetch_add(1);
    std::atomic<int> m_Count{1};
};

void Give(const ScriptVal& value) {
    ScriptVal replaced = value;
    std::lock_guard guard(s_Lock);
    if (!s_HasStore) return;
    if (s_Store.size() < 16) s_Store.emplace_back();
    size_t i = static_cast<size_t>(s_NextNumber.load()) % s_Store.size();
    std::swap(s_Store[i], replaced);
}

ScriptVal Take() {
    std::lock_guard guard(s_Lock);
    if (s_Store.empty()) return {};
    return s_Store[static_cast<size_t>(s_NextNumber.load()) % s_Store.size()];
}

bool IsAlive(double number) {
    std::lock_guard guard(s_Lock);
    return s_Alive.count(number) > 0;
}

KORVEL_PUBLISH(Token, "Token", "Has a number.", "")
KORVEL_OPCODE(Token, SST_Call, SSF_AnyThread) {
    args.Return(args[1]);
}
KORVEL_OPCODE(Token, SST_Unm, SSF_AnyThread) {
    args.ReturnNumber(self.m_Number);
}
KORVEL_OPCODE(Token, SST_Add, SSF_AnyThread) {
    Token* made = new Token;
    args.ReturnObject(made);
    args.ReturnNumber(made->m_Number);
    made->DecRef();
}
KORVEL_OPCODE(Token, SST_Mul, SSF_AnyThread) {
    Give(args[1]);
}
KORVEL_OPCODE(Token, SST_Div, SSF_AnyThread) {
    args.Return(Take());
}
KORVEL_PUBLISHED(Token);

// One life of a connection, with its ends that are in this process.
struct Run {
    ~Run() {
        for (ScriptVal& root : m_Roots) root = SV_Nil;
        for (RemoteApp* app : m_Apps) {
            if (app) app->Recycle();
        }
    }

    bool IsOpen() const {
        for (RemoteApp* app : m_Apps) {
            if (app && !app->Connected()) return false;
        }
        return true;
    }

    RemoteApp* m_Apps[2] = {};
    ScriptVal m_Roots[2];  // the other side's application
    std::atomic<bool> m_IsDying{false};
};
using RunPtr = std::shared_ptr<Run>;

enum class Form { Sockets, InProcess, Processes };

// What one process does in a soak.
class Soak {
public:
    Soak(Form form, bool isChild, const Listener* listener, unsigned seed)
        : m_Form(form), m_IsChild(isChild), m_Listener(listener), m_Random(seed) {
        m_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_Root; };
        s_Root = new Token;
        g_ScriptConfig = &m_Config;
        s_HasStore = true;
        for (Token*& token : m_Kept) token = new Token;
        for (RunPtr& slot : m_Slots) slot = Connect(nullptr);
    }

    ~Soak() {
        for (Token* token : m_Kept) {
            EXPECT_EQ(token->m_Count, 1) << "what its owner alone holds";
            token->DecRef();
        }
        s_Root->DecRef();
        EXPECT_TRUE(WaitUntil([] {
            std::lock_guard guard(s_Lock);
            return s_Alive.empty();
        }));
        g_ScriptConfig = nullptr;
    }

    // Until it is over. The child only makes again what the parent has ended. `meet` returns when
    // both have come to it.
    void Work(const std::function<bool()>& isOver, const std::function<void()>& meet) {
        std::vector<std::thread> workers;
        for (int i = 0; i < kNumWorkers; i++) {
            workers.emplace_back([this, seed = m_Random()] { WorkOne(Random(seed)); });
        }
        while (!isOver()) {
            Platform::Wait(m_IsChild ? 1 : m_Random() % 20);
            RunPtr& slot = m_Slots[m_Random() % kNumSlots];
            bool isDead = !slot->IsOpen();
            if (isDead || (!m_IsChild && m_Random() % 2)) Replace(slot);
        }
        m_MustStop = true;
        for (std::thread& worker : workers) worker.join();
        Settle(meet);
    }

private:
    struct Held {
        ScriptVal m_Value;
        double m_Number;
        RunPtr m_Run;  // of an object that the peer has made for us alone; null of our own
        bool m_IsNew;  // our own, which no peer has had before
    };

    RunPtr Connect(Run* old) {
        auto run = std::make_shared<Run>();
        bool isPair = m_Form != Form::Processes;
        for (int side = 0; side < (isPair ? 2 : 1); side++) {
            RemoteApp* app = old ? old->m_Apps[side] : new RemoteApp("soak", 0, nullptr);
            if (old) app->Use();
            app->SetTimeOut(kLimitMs / 1000);
            run->m_Apps[side] = app;
        }
        if (m_Form == Form::InProcess) {
            EXPECT_TRUE(RemoteApp::Join(run->m_Apps[0], run->m_Apps[1]));
        } else {
            Platform::_Socket* near = nullptr;
            if (isPair) {
                Ends ends(*m_Listener);
                near = ends.m_Near;
                EXPECT_TRUE(run->m_Apps[1]->Connect(ends.m_Far));
            } else {
                near = m_IsChild ? m_Listener->Connect() : m_Listener->Accept();
            }
            EXPECT_TRUE(run->m_Apps[0]->Connect(near));
        }
        for (int side = 0; side < 2; side++) {
            if (run->m_Apps[side]) run->m_Roots[side] = run->m_Apps[side]->FindRemoteObject(1);
        }
        return run;
    }

    // Ends a connection in one of the ways there are, and makes another one, with the same objects
    // or new ones.
    void Replace(RunPtr& slot) {
        RunPtr run = slot;
        run->m_IsDying = true;
        unsigned way = m_Random() % 4;
        RemoteApp* app = run->m_Apps[run->m_Apps[1] ? m_Random() % 2 : 0];
        if (m_Form != Form::InProcess && way < 2) {
            Platform::ShutdownSocket(app->GetSocket(), way ? 3 : 2);  // as a broken wire does
        } else if (way == 3) {
            {
                std::lock_guard guard(m_SlotLock);
                slot = nullptr;  // it ends when nobody works on it
            }
            app->Disconnect();
        } else {
            app->_Disconnect(way ? kLimitMs : 0);
        }
        EXPECT_TRUE(WaitUntil([&] {
            for (RemoteApp* each : run->m_Apps) {
                if (each && each->Connected()) return false;
            }
            return true;
        }));
        RunPtr next = Connect(m_Random() % 2 ? run.get() : nullptr);
        std::lock_guard guard(m_SlotLock);
        slot = next;
    }

    RunPtr TakeSlot(Random& random) {
        std::lock_guard guard(m_SlotLock);
        return m_Slots[random() % kNumSlots];
    }

    // In this order: the same objects may connect again once it is dying.
    static bool HasEnded(const Run& run) { return !run.IsOpen() || run.m_IsDying; }

    // A call whose failure the end of the connection must explain.
    bool Call(const Run& run, const ScriptVal& proxy, int op, const ScriptVal& arg,
              ScriptVal& result) {
        ScriptArgs args;
        args.SetArguments(arg);
        if (proxy.ToRemoteObject()->DoCommand(op, args, result)) return true;
        EXPECT_TRUE(HasEnded(run)) << "a call without a reply";
        return false;
    }

    // An object that the peer has made for us alone lives as long as the connection.
    void Ask(const Held& held) {
        ScriptVal result;
        if (!Call(*held.m_Run, held.m_Value, SST_Unm, {}, result)) return;
        bool isRight = result[-1] == held.m_Number;
        EXPECT_TRUE(isRight || held.m_Run->m_IsDying) << "object " << held.m_Number;
        bool isAlive = m_Form == Form::Processes || IsAlive(held.m_Number);
        EXPECT_TRUE(isAlive || HasEnded(*held.m_Run)) << "object " << held.m_Number;
    }

    void Echo(const Run& run, const ScriptVal& root, Held& held, Random& random) {
        bool isNew = std::exchange(held.m_IsNew, false);
        std::vector<char> bytes(random() % 300 == 0 ? 200000 : random() % 500);
        for (char& byte : bytes) byte = static_cast<char>(random());
        ScriptVal block = MemBlock(bytes.data(), static_cast<uint32_t>(bytes.size()));
        ScriptVal sent(SV_Table, nullptr), result;
        sent[1] = block;
        sent["object"] = held.m_Value;
        if (!Call(run, root, SST_Call, sent, result) || run.m_IsDying) return;
        const ScriptVal& object = result[-1]["object"];
        EXPECT_TRUE(result[-1][1] == block);
        // A release of an earlier time, still on its way, may have taken what we have sent again:
        // the peer's proxy then has a number that is gone. Proxies come back as they were, or have
        // no name on this connection.
        bool isHome = held.m_Run.get() == &run && held.m_Value.GetApp() == root.GetApp();
        bool mayBeGone = held.m_Run ? !isHome : !isNew;
        EXPECT_TRUE(object == held.m_Value || (object.IsNil() && mayBeGone))
            << "object " << held.m_Number;
    }

    static bool CountReply(void* data, RemoteApp* app, Packet* reply, unsigned int) {
        ScriptVal result;
        EXPECT_TRUE(!reply || ScriptVal::FromPacket(app, reply, nullptr, &result));
        FreePkt(reply);
        static_cast<Soak*>(data)->m_NumPending--;
        return true;
    }

    void WorkOne(Random random) {
        std::vector<Held> bag;
        while (!m_MustStop) {
            RunPtr run = TakeSlot(random);
            if (!run) {
                std::this_thread::yield();
                continue;
            }
            int side = run->m_Apps[1] ? static_cast<int>(random() % 2) : 0;
            const ScriptVal& root = run->m_Roots[side];
            if (bag.size() >= kMostHeld || (!bag.empty() && random() % 8 == 0)) {
                std::swap(bag[random() % bag.size()], bag.back());
                bag.pop_back();
            }
            Held* any = bag.empty() ? nullptr : &bag[random() % bag.size()];
            ScriptVal result;
            switch (random() % 8) {
                case 0: {
                    Token* made = new Token;
                    bag.push_back({ScriptVal(made), made->m_Number, nullptr, true});
                    made->DecRef();
                    break;
                }
                case 1: {
                    Token* kept = m_Kept[random() % kNumKept];
                    bag.push_back({ScriptVal(kept), kept->m_Number, nullptr, false});
                    break;
                }
                case 2:
                    if (!Call(*run, root, SST_Add, {}, result)) break;
                    if (result[-1].IsRemoteObject()) {
                        bag.push_back({result[-1], result[-2].ToNumber(), run, false});
                    } else {
                        EXPECT_TRUE(HasEnded(*run));
                    }
                    break;
                case 3:
                    if (any && any->m_Run) Ask(*any);
                    break;
                case 4:
                    if (any) {
                        any->m_IsNew = false;
                        Call(*run, root, SST_Mul, any->m_Value, result);
                    }
                    break;
                case 5: {  // a stranger
                    if (!Call(*run, root, SST_Div, {}, result)) break;
                    ScriptVal value = result[-1];
                    if (!value.IsRemoteObject()) break;
                    if (!Call(*run, value, SST_Unm, {}, result)) break;
                    EXPECT_TRUE(result[-1].IsNumber() || result["Error"] == 10);
                    break;
                }
                case 6:
                    if (any) {
                        any->m_IsNew = false;
                        ScriptArgs args;
                        args.SetArguments(any->m_Value);
                        m_NumPending++;
                        bool isSent =
                            root.ToRemoteObject()->DoCommandAsync(SST_Call, args, CountReply, this);
                        if (!isSent) m_NumPending--;
                    }
                    break;
                default:
                    if (any) Echo(*run, root, *any, random);
                    break;
            }
        }
    }

    // Nothing is held any more, so all counts go back on the connections as they are; then those
    // end.
    void Settle(const std::function<void()>& meet) {
        meet();
        s_HasStore = false;
        std::vector<ScriptVal> store;
        {
            std::lock_guard guard(s_Lock);
            store.swap(s_Store);
        }
        store.clear();
        EXPECT_TRUE(WaitUntil([&] { return m_NumPending == 0; })) << "waiters are left";
        meet();
        for (RunPtr& run : m_Slots) {
            EXPECT_TRUE(run->IsOpen());
            for (RemoteApp* app : run->m_Apps) {
                // Ours, the thread's, the application on either side, and the joined peer's.
                uint32_t numUses = m_Form == Form::InProcess ? 5 : 4;
                if (!app) continue;
                EXPECT_TRUE(WaitUntil([&] { return app->GetUseCount() == numUses; }))
                    << "uses are left: " << app->GetUseCount();
            }
        }
        EXPECT_TRUE(WaitUntil([&] {
            std::lock_guard guard(s_Lock);
            return s_Alive.size() == 1 + kNumKept;
        })) << "objects are left";
        meet();
        for (RunPtr& slot : m_Slots) {
            RunPtr run = std::exchange(slot, nullptr);
            for (ScriptVal& root : run->m_Roots) root = SV_Nil;
            for (RemoteApp* app : run->m_Apps) {
                if (!app) continue;
                app->_Disconnect(kLimitMs);
                EXPECT_TRUE(WaitUntil([&] { return app->GetUseCount() == 1; }))
                    << "uses are left: " << app->GetUseCount();
            }
        }
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
    }

    static inline Token* s_Root;
    const Form m_Form;
    const bool m_IsChild;
    const Listener* const m_Listener;
    Random m_Random;
    ScriptConfig m_Config;
    Token* m_Kept[kNumKept];
    std::mutex m_SlotLock;
    RunPtr m_Slots[kNumSlots];  // others look at them under the lock
    std::atomic<bool> m_MustStop{false};
    std::atomic<int> m_NumPending{0};
};

std::function<bool()> After(double seconds) {
    return [end = Clock::now() + std::chrono::duration<double>(seconds)] {
        return Clock::now() >= end;
    };
}

double GetSeconds() {
    return GetSetting("KORVEL_SOAK_SECONDS", 3) / kNumVariants;
}

unsigned GetSeed() {
    double random = std::random_device()() >> 1;
    auto seed = static_cast<unsigned>(GetSetting("KORVEL_SOAK_SEED", random));
    printf("KORVEL_SOAK_SEED=%u\n", seed);
    return seed;
}

class SoakTest : public testing::TestWithParam<Form> {};

TEST_P(SoakTest, LeavesNothingBehind) {
    constexpr size_t kMostGrowth = 256 * 1024;
    int numRounds = std::max(4, static_cast<int>(GetSeconds() / 5));
    Random seeds(GetSeed());
    size_t numBytes = 0;
    for (int i = 0; i < numRounds && !HasFailure(); i++) {
        int numDescriptors = CountDescriptors();
        {
            Listener listener;
            Soak soak(GetParam(), false, &listener, seeds());
            soak.Work(After(GetSeconds() / numRounds), [] {});
        }
        EXPECT_TRUE(WaitUntil([&] { return CountDescriptors() == numDescriptors; }));
        if (i == 1) numBytes = CountBytes();
        EXPECT_TRUE(i < 2 || CountBytes() < numBytes + kMostGrowth) << "round " << i;
    }
}

INSTANTIATE_TEST_SUITE_P(Forms, SoakTest, testing::Values(Form::Sockets, Form::InProcess),
                         [](const auto& form) {
                             bool isInProcess = form.param == Form::InProcess;
                             return std::string(isInProcess ? "InProcess" : "Sockets");
                         });

TEST(SoakProcesses, LeaveNothingBehind) {
    unsigned seed = GetSeed();
    fflush(stdout);
    int toChild[2], toParent[2];
    ASSERT_TRUE(pipe(toChild) == 0 && pipe(toParent) == 0);
    Listener listener;
    pid_t child = fork();
    ASSERT_GE(child, 0);
    // Each waits for the other one's byte.
    auto meet = [&] {
        char byte = 0;
        EXPECT_EQ(write(child ? toChild[1] : toParent[1], &byte, 1), 1);
        EXPECT_EQ(read(child ? toParent[0] : toChild[0], &byte, 1), 1);
    };
    auto isOver = [&, isLate = After(GetSeconds())] {
        if (child) return isLate();
        pollfd entry = {toChild[0], POLLIN, 0};
        return poll(&entry, 1, 0) > 0;
    };
    Soak(Form::Processes, child == 0, &listener, seed + (child == 0)).Work(isOver, meet);
    if (!child) {
        fflush(stdout);
        _exit(HasFailure());
    }
    int status = -1;
    EXPECT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
    for (int fd : {toChild[0], toChild[1], toParent[0], toParent[1]}) close(fd);
}

}  // namespace
}  // namespace Korvel

// Many threads connect by name while hosts come and go, this process among them.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "ServerFixture.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptServer.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;

class Answering : public Scripted<RefObject> {
    KORVEL_SCRIPTED(Answering)
public:
    Answering() { SetScriptClass(); }
};
KORVEL_PUBLISH(Answering, "Answering", "", "")
KORVEL_FUNCTION(Answering, Twice, SSF_AnyThread) {
    args.ReturnNumber(2 * args[1].ToNumber());
}
KORVEL_PUBLISHED(Answering);

std::atomic<bool> s_MustEnd;
std::atomic<int> s_NumGood, s_NumTried, s_NumWrong;

// A time-out is for a peer that dies while it is asked.
constexpr double kTimeOut = 5;

void Connect(std::mt19937 random) {
    constexpr const char* kNames[] = {"Stress", "!Stress", "MediaHost", "!MediaHost", nullptr, "!"};
    std::vector<ScriptVal> kept(4);
    while (!s_MustEnd) {
        size_t which = random() % std::size(kNames);
        s_NumTried++;
        if (random() % 8 == 0) {  // not waited for
            const char* name = kNames[which] ? kNames[which] + (*kNames[which] == '!') : "";
            kept[random() % kept.size()] =
                AsyncScriptApp(name, nullptr, ScriptVal(), "127.0.0.1", kTimeOut, true);
            continue;
        }
        ScriptVal root = ScriptApp(kNames[which], nullptr, ScriptVal(), "127.0.0.1", kTimeOut);
        if (root.IsNil()) continue;
        s_NumGood++;
        if (which < 2) {
            ScriptVal answer = root.CallMember("Twice", 21);
            // It ends when this process stops.
            if (answer != 42 && !answer.IsNil()) s_NumWrong++;
        } else if (which < 4) {
            root.CallMember("GetPingInfo");
        } else {
            root.CallMember("GetHostList");
        }
        kept[random() % kept.size()] = root;
    }
}

// KORVEL_SOAK_SECONDS is its time.
TEST(ConnectStress, HostsComeAndGo) {
    using Clock = std::chrono::steady_clock;
    const char* setting = getenv("KORVEL_SOAK_SECONDS");
    auto end = Clock::now() + std::chrono::duration<double>(setting ? atof(setting) : 3);
    int numDescriptors = CountDescriptors();
    static ptr<Answering> s_App(new Answering);
    static ScriptConfig s_Config;
    s_Config.m_Flags = SCF_Host | SCF_Standard;
    s_Config.m_AppName = "Stress";
    s_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_App.Get(); };
    g_ScriptConfig = nullptr;
    _InitScripting(s_Config);
    {
        ServerProcess server(g_ScriptServerPort, "4294967295");
        ASSERT_TRUE(server.AwaitLine("Started"));
        ASSERT_TRUE(StartScripting(ScriptVal()));
        auto host = std::make_unique<HostProcess>(MEDIAHOST);
        s_MustEnd = false;
        std::vector<std::thread> threads;
        std::random_device seed;
        for (int i = 0; i < 8; i++) threads.emplace_back(Connect, std::mt19937(seed()));
        std::thread hosts([&] {
            for (bool mustKill = false; !s_MustEnd; mustKill = !mustKill) {
                EXPECT_TRUE(WaitUntil([before = s_NumTried.load()] {
                    return s_MustEnd || s_NumTried > before + 100;
                }));
                host->End(mustKill ? SIGKILL : SIGTERM);
                host = std::make_unique<HostProcess>(MEDIAHOST);
            }
        });
        int numStarts = 0;
        while (Clock::now() < end) {
            EXPECT_TRUE(WaitUntil([&, before = s_NumTried.load()] {
                return s_NumTried > before + 20 || Clock::now() >= end;
            }));
            StopScripting();
            EXPECT_TRUE(StartScripting(ScriptVal()));
            numStarts++;
        }
        s_MustEnd = true;
        for (std::thread& thread : threads) thread.join();
        hosts.join();
        printf("%d starts, %d of %d attempts were good\n", numStarts, s_NumGood.load(),
               s_NumTried.load());
        EXPECT_GT(s_NumGood, 0);
        EXPECT_EQ(s_NumWrong, 0);
        // After all that, everybody finds everybody.
        for (const char* name : {"Stress", "MediaHost", "!Stress"}) {
            EXPECT_TRUE(ScriptApp(name, nullptr, ScriptVal(), "127.0.0.1", 60).IsRemoteObject())
                << name;
        }
        CleanupScripting();
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
        EXPECT_TRUE(WaitUntil([] { return s_App->GetUseCount() == 1; }));
    }
    EXPECT_TRUE(WaitUntil([&] { return CountDescriptors() <= numDescriptors + 1; }))
        << CountDescriptors() << " were " << numDescriptors;
    g_ScriptConfig = nullptr;
}

}  // namespace
}  // namespace Korvel

// How a host makes itself known: registering, the servers that come and go, and what it tells
// others. The test's own process plays the server, at a port of the test's.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <deque>
#include <fstream>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "RemoteFixture.h"
#include "Support.h"
#include "remote/ListenerInternal.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptPortInternal.h"
#include "remote/ScriptServer.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;
using Platform::_Socket;

// The host's object, and the server's, too: there is one for each process.
class Registry : public Scripted<RefObject> {
    KORVEL_SCRIPTED(Registry)
public:
    Registry() { SetScriptClass(); }

    // What has been called, in its order.
    static void Note(const std::string& call) {
        std::lock_guard guard(s_Mutex);
        s_Calls.push_back(call);
    }
    static std::string TakeCalls() {
        std::lock_guard guard(s_Mutex);
        std::string all;
        for (const std::string& call : s_Calls) all += call + ";";
        s_Calls.clear();
        return all;
    }

    static inline std::mutex s_Mutex;
    static inline std::deque<std::string> s_Calls;
    static inline std::atomic<bool> s_IsSilent;
    static inline KorvelScript::Event s_Gate;
};
KORVEL_PUBLISH(Registry, "Registry", "", "")
KORVEL_FUNCTION(Registry, AddHost, SSF_AnyThread) {
    const ScriptVal& info = args[1];
    bool isWhole = info["ProcessID"] == getpid() && info["UUID"] == GetAppUUID() &&
                   info["Port"].IsNumber() && info["Kind"] == "test";
    Registry::Note(std::string("Add ").append(isWhole ? info["Name"].ToString("?") : "part"));
    if (Registry::s_IsSilent) Registry::s_Gate.Wait(kLimitMs);
    args.ReturnBoolean(true);
}
KORVEL_FUNCTION(Registry, RemoveHost, SSF_AnyThread) {
    if (Registry::s_IsSilent) Registry::s_Gate.Wait(kLimitMs);
    Registry::Note(args[1] == getpid() ? "Remove" : "Remove another");
    args.ReturnBoolean(true);
}
KORVEL_FUNCTION(Registry, NotifyHosts, SSF_AnyThread) {
    Registry::Note(std::string("Notify ").append(args[1].ToString("?")) + args[2].ToString("?") +
                   (args[3].ToBoolean() ? " all" : " others"));
}
KORVEL_FUNCTION(Registry, Hear, SSF_AnyThread) {
    std::string heard = args[1].IsRemoteObject() ? "object" : "none";
    for (int i = 2; i <= 9; i++)
        heard += "," + std::to_string(static_cast<int>(args[i].ToNumber(-1)));
    Registry::Note(heard);
}
KORVEL_PUBLISHED(Registry);

// Listens at a port and serves who calls, until it ends.
class Server {
public:
    explicit Server(unsigned int port) {
        EXPECT_TRUE(m_Listener.Open(port, kLoopback));
        Platform::SetSocketNonBlocking(m_Listener.GetSocket(), false);
        m_Thread = std::thread([this] {
            for (;;) {
                _Socket* socket = Platform::AcceptSocket(m_Listener.GetSocket());
                if (socket == Platform::kNoSocket) return;
                ptr<RemoteApp> app(new RemoteApp("", 0, nullptr));
                ScriptVal root = ScriptApp(app.Get(), socket, nullptr, ScriptVal());
                m_Peers.emplace_back(app, root);
            }
        });
    }
    Server(const Server&) = delete;
    Server& operator=(const Server&) = delete;
    ~Server() {
        Platform::ShutdownSocket(m_Listener.GetSocket(), 3);
        m_Thread.join();
        for (auto& [app, root] : m_Peers) app->_Disconnect(kLimitMs);
    }

    // Once nobody calls any more.
    int CountOpen() const {
        int count = 0;
        for (auto& [app, root] : m_Peers) count += app->Connected();
        return count;
    }

private:
    Korvel::Listener m_Listener;
    std::thread m_Thread;
    std::vector<std::pair<ptr<RemoteApp>, ScriptVal>> m_Peers;
};

class RegistrationTest : public testing::Test {
protected:
    RegistrationTest() {
        s_This = this;
        m_Config.m_Flags = SCF_Host | SCF_Standard;
        m_Config.m_AppName = "Tester";
        m_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_This->m_App.Get(); };
        m_Info["Kind"] = "test";
        g_ScriptConfig = nullptr;
        _InitScripting(m_Config);
        Korvel::Test::Listener free;  // whose port nobody else is given for a while
        g_ScriptServerPort = free.m_Port;
        Registry::s_IsSilent = false;
        Registry::TakeCalls();
    }
    ~RegistrationTest() override {
        CleanupScripting();
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
        g_ScriptConfig = nullptr;
        g_ScriptServerPort = m_OldPort;
    }

    void StartServer() { m_Server = std::make_unique<Server>(g_ScriptServerPort); }

    // The tool that hosts start. It writes what it is told to a file.
    void MakeTool() {
        chmod(m_Dir
                  .Write("tool", "#!/bin/sh\necho \"$@\" > " + m_Dir.Path("part") + "\nmv " +
                                     m_Dir.Path("part") + " " + m_Dir.Path("told") + "\n")
                  .c_str(),
              0700);
    }
    std::string AwaitTool() {
        std::string told;
        EXPECT_TRUE(WaitUntil([&] {
            std::ifstream file(m_Dir.Path("told"));
            return static_cast<bool>(std::getline(file, told));
        }));
        unlink(m_Dir.Path("told").c_str());
        return told;
    }

    template <class Step>
    static double TakeSeconds(Step&& step) {
        auto start = std::chrono::steady_clock::now();
        step();
        return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    }

    static inline RegistrationTest* s_This;
    const unsigned int m_OldPort = g_ScriptServerPort;
    ScriptConfig m_Config;
    ptr<Registry> m_App{new Registry};
    ScriptVal m_Info{SV_Table, nullptr};
    std::unique_ptr<Server> m_Server;
    TempDir m_Dir;
    Setting m_Tool{"KORVEL_Tool", m_Dir.Path("tool").c_str(), "/nonexistent"};
    Setting m_Again{"KORVEL_RegisterAgainSeconds", "0", "10"};
};

TEST_F(RegistrationTest, RegistersAsOftenAsItStarts) {
    StartServer();
    int numDescriptors = 0;
    for (int i = 0; i < 10; i++) {
        ASSERT_TRUE(StartScripting(m_Info));
        EXPECT_EQ(Registry::TakeCalls(), "Add Tester;");
        EXPECT_TRUE(GetServer().IsRemoteObject() && GetHost() == true);
        StopScripting();
        EXPECT_EQ(Registry::TakeCalls(), "Remove;");
        EXPECT_TRUE(GetServer().IsNil() && GetHost() == true);
        EXPECT_FALSE(m_Config.m_Active);
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
        if (i == 0) numDescriptors = CountDescriptors();
    }
    EXPECT_TRUE(WaitUntil([&] { return CountDescriptors() <= numDescriptors; }));
}

TEST_F(RegistrationTest, GoesOnWithoutAServer) {
    EXPECT_TRUE(StartScripting(m_Info));  // nor is there a tool
    EXPECT_TRUE(GetServer().IsNil());
    EXPECT_TRUE(NotifyHosts("Hear", 1, true));
    ScriptVal reply;
    EXPECT_TRUE(ScriptApp(kLoopback, GetListenPort(), reply, 60).IsRemoteObject());
    StartServer();  // later
    EXPECT_TRUE(WaitUntil([] { return GetServer().IsRemoteObject(); }));
    EXPECT_EQ(Registry::TakeCalls(), "Add Tester;");
    NotifyHosts("Hear", "news", true);
    NotifyHosts("Hear", "more", false);
    EXPECT_TRUE(GetServer().CallMember("RemoveHost", getpid()) == true);  // behind the others
    EXPECT_EQ(Registry::TakeCalls(), "Notify Hearnews all;Notify Hearmore others;Remove;");
}

TEST_F(RegistrationTest, StartsAServerWhenThereIsNone) {
    MakeTool();
    std::thread server([this] {
        EXPECT_EQ(AwaitTool(), "-s");
        StartServer();
    });
    EXPECT_TRUE(StartScripting(m_Info));
    server.join();
    EXPECT_TRUE(GetServer().IsRemoteObject());
    // And again when it has gone.
    for (int i = 0; i < 3; i++) {
        EXPECT_EQ(Registry::TakeCalls(), "Add Tester;");
        m_Server.reset();
        EXPECT_TRUE(WaitUntil([] { return GetServer().IsNil(); }));
        EXPECT_EQ(AwaitTool(), "-s");
        StartServer();
        EXPECT_TRUE(WaitUntil([] { return GetServer().IsRemoteObject(); }));
    }
}

// One that others have lost at the same time gets them back one by one.
TEST_F(RegistrationTest, WaitsBeforeItRegistersAgain) {
    Setting again("KORVEL_RegisterAgainSeconds", "1", "0");
    StartServer();
    ASSERT_TRUE(StartScripting(m_Info));
    double taken = TakeSeconds([this] {
        m_Server.reset();
        EXPECT_TRUE(WaitUntil([] { return GetServer().IsNil(); }));
        StartServer();
        EXPECT_TRUE(WaitUntil([] { return GetServer().IsRemoteObject(); }));
    });
    EXPECT_GE(taken, 1);
}

// A server that hangs, at the start, at the end and between: nothing waits for the five seconds
// that a call may take. A pause of the whole machine may, but not each time.
TEST_F(RegistrationTest, StopsInTimeWhateverTheServerDoes) {
    Setting again("KORVEL_RegisterAgainSeconds", "3600", "0");
    auto stop = [] {
        double taken = TakeSeconds([] { StopScripting(); });
        EXPECT_FALSE(g_ScriptingActive);
        Registry::s_Gate.Signal();
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
        Registry::s_IsSilent = false;
        Registry::TakeCalls();
        return taken;
    };
    auto stopStarting = [&] {
        Registry::s_IsSilent = true;
        std::thread start([this] { StartScripting(m_Info); });
        EXPECT_TRUE(WaitUntil([] { return Registry::TakeCalls() == "Add Tester;"; }));
        double taken = stop();
        start.join();
        return taken;
    };
    auto stopStarted = [&] {
        EXPECT_TRUE(StartScripting(m_Info));
        Registry::s_IsSilent = true;
        return stop();
    };
    auto stopWaiting = [&] {
        EXPECT_TRUE(StartScripting(m_Info));
        m_Server.reset();  // it waits for an hour
        EXPECT_TRUE(WaitUntil([] { return GetServer().IsNil(); }));
        return stop();
    };
    const std::function<double()> steps[] = {stopStarting, stopStarted, stopWaiting};
    for (const auto& step : steps) {
        double least = 5;
        for (int i = 0; i < 3 && least >= 4; i++) {
            if (!m_Server) StartServer();
            least = std::min(least, step());
        }
        EXPECT_LT(least, 4);
    }
}

// What has to be done on the UI thread is queued; the rest goes on beside it.
TEST_F(RegistrationTest, StartsLaterWhereTheHostMustNotBlock) {
    static std::deque<std::function<void()>> jobs;
    static std::mutex mutex;
    m_Config.UIExecute = [](ScriptConfig::UIFunction function, void* a, void* b, bool) {
        std::lock_guard guard(mutex);
        jobs.push_back([=] { function(a, b); });
        return 0ull;
    };
    auto runUI = [] {
        std::unique_lock lock(mutex);
        while (!jobs.empty()) {
            auto job = jobs.front();
            jobs.pop_front();
            lock.unlock();
            job();
            lock.lock();
        }
    };
    StartServer();
    {
        Setting nowhere("KORVEL_ListenAddress", "203.0.113.5", "");
        DeferStartScripting(m_Info);
        runUI();
        EXPECT_FALSE(m_Config.m_Active || StartScripting(m_Info));
    }
    for (bool isStopped : {true, false}) {
        DeferStartScripting(m_Info);
        DeferStartScripting(m_Info);
        EXPECT_TRUE(m_Config.m_Active && GetListenPort() == 0);
        if (isStopped) StopScripting();
        EXPECT_EQ(m_Config.m_Active, !isStopped);
        runUI();
        EXPECT_EQ(GetListenPort() != 0, !isStopped);
        EXPECT_FALSE(g_ScriptingActive) << "the server needs the UI thread for its answer";
    }
    EXPECT_TRUE(WaitUntil([&] {
        runUI();
        return g_ScriptingActive.load();
    }));
    EXPECT_TRUE(StartScripting(m_Info));
    EXPECT_TRUE(GetServer().IsRemoteObject());
    std::thread stop([] { StopScripting(); });
    EXPECT_TRUE(WaitUntil([&] {
        runUI();
        return !m_Config.m_Active;
    }));
    stop.join();
    runUI();
    EXPECT_EQ(Registry::TakeCalls(), "Add Tester;Remove;");
    m_Config.UIExecute = nullptr;
    // A client has nothing to wait for.
    m_Config.m_Flags = SCF_Standard;
    DeferStartScripting(m_Info);
    EXPECT_TRUE(g_ScriptingActive && !m_Config.m_Active && GetListenPort() == 0);
    EXPECT_TRUE(GetServer().IsNil());
}

TEST_F(RegistrationTest, NotifiesEachTargetOnce) {
    ASSERT_TRUE(StartScripting(m_Info));
    auto call = [] {
        _Socket* socket = Platform::NewSocket(Platform::ST_TCP);
        Platform::ConnectSocket(socket, GetListenPort(), kLoopback);
        return ScriptApp(socket, "caller", ScriptVal());
    };
    ScriptVal first = call(), second = call();
    ScriptVal targets(SV_Table, nullptr), nil;
    targets[1] = first;
    targets["other"] = second;
    targets[2] = "no target";
    auto send = [&](RemoteApp* exclude, const ScriptVal& target, ScriptObject* object) {
        SendNotifyExclude(exclude, target, "Hear", object, 2, 3, 4, 5, 6, 7, 8, nil);
        // Whoever has heard it has heard it by then.
        for (ScriptVal* root : {&first, &second}) root->CallMember("AddHost", m_Info);
        std::string calls = Registry::TakeCalls();
        for (size_t at; (at = calls.find("Add part;")) != calls.npos;) calls.erase(at, 9);
        return calls;
    };
    const std::string heard = "none,2,3,4,5,6,7,8,-1;";
    EXPECT_EQ(send(nullptr, targets, nullptr), heard + heard);
    EXPECT_EQ(send(first.GetApp(), targets, nullptr), heard);
    EXPECT_EQ(send(nullptr, second, nullptr), heard);
    EXPECT_EQ(send(nullptr, "no target", nullptr), "");
    EXPECT_EQ(send(nullptr, first, m_App.Get()), "object,2,3,4,5,6,7,8,-1;");
}

// Those who say nothing make room, the oldest first; those who have spoken stay.
TEST_F(RegistrationTest, EndsTheOldestOfManySilentCallers) {
    constexpr int kMostSilent = 64;
    Setting seconds("KORVEL_SilentSeconds", "0", "30");
    ASSERT_TRUE(StartScripting(m_Info));
    auto call = [] {
        _Socket* socket = Platform::NewSocket(Platform::ST_TCP);
        Platform::ConnectSocket(socket, GetListenPort(), kLoopback);
        return socket;
    };
    ScriptVal good = ScriptApp(call(), "good", ScriptVal());
    EXPECT_TRUE(good.CallMember("RemoveHost", 0) == true);
    std::vector<_Socket*> silent;
    for (int i = 0; i < kMostSilent + 6; i++) silent.push_back(call());
    for (int i = 0; i < 6; i++) {
        char byte;
        EXPECT_EQ(Platform::SocketReceive(silent[i], &byte, 1, nullptr, nullptr), 0);
        Platform::DeleteSocket(silent[i]);
    }
    // The others, and both ends of the good one
    EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == kMostSilent + 2; }));
    EXPECT_TRUE(good.CallMember("RemoveHost", 0) == true);
    {
        Setting patient("KORVEL_SilentSeconds", "3600", "0");
        for (int i = 0; i < 6; i++) silent[i] = call();
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == kMostSilent + 8; }))
            << "nobody has been silent for long";
    }
    for (_Socket* socket : silent) Platform::DeleteSocket(socket);
}

// A script in a process of its own: what it is told, and what waits for it.
TEST_F(RegistrationTest, StartsScriptsInProcessesOfTheirOwn) {
    EXPECT_FALSE(StartScriptProcess("Lua", "a.lua", m_Info)) << "it could not call this process";
    ASSERT_TRUE(StartScripting(m_Info));
    EXPECT_FALSE(StartScriptProcess("Lua", "a.lua", m_Info)) << "there is no tool";
    MakeTool();
    EXPECT_FALSE(StartScriptProcess("Lua", "a\" -s \".lua", m_Info));
    EXPECT_FALSE(StartScriptProcess("Lua", nullptr, m_Info));
    char folder[4096];
    ASSERT_NE(getcwd(folder, sizeof(folder)), nullptr);
    std::string options = "-q -l Lua -a " + std::to_string(GetListenPort()) + " ";
    for (const auto& [file, path] :
         {std::pair<std::string, std::string>{"/x y/$(z).lua", "/x y/$(z).lua"},
          {"a b.lua", std::string(folder) + "/a b.lua"}}) {
        EXPECT_TRUE(StartScriptProcess("Lua", file.c_str(), m_Info));
        EXPECT_EQ(AwaitTool(), options + path);
        KorvelScript::AutoLock guard(g_ProcLock);
        TableEntry* entry = nullptr;
        int count = 0;
        while (g_ProcIDs.NextKey(entry)) count += entry->m_Value["Kind"] == "test";
        EXPECT_GE(count, 1);
        EXPECT_LE(count, 2);
    }
    // They end without asking for it.
    EXPECT_TRUE(WaitUntil([] {
        ReapChildren();
        KorvelScript::AutoLock guard(g_ProcLock);
        return g_ProcIDs.NumKeys() == 0;
    }));
}

}  // namespace
}  // namespace Korvel

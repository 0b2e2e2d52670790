// How connections come about: who calls, who is called, and what goes wrong.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "RemoteFixture.h"
#include "Support.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptPortInternal.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;
using Platform::_Socket;

class Application : public Scripted<RefObject> {
    KORVEL_SCRIPTED(Application)
public:
    Application() { SetScriptClass(); }
};
KORVEL_PUBLISH(Application, "Application", "", "")
KORVEL_FUNCTION(Application, Twice, SSF_AnyThread) {
    args.ReturnNumber(2 * args[1].ToNumber());
}
KORVEL_PUBLISHED(Application);

// Answers every call in the same way.
class Answerer : public Scripted<RefObject> {
    KORVEL_SCRIPTED(Answerer)
public:
    Answerer() { SetScriptClass(); }
    static inline ScriptVal s_Answer;
};
KORVEL_PUBLISH(Answerer, "Answerer", "", "")
KORVEL_OPCODE(Answerer, SST_CallMemberFunction, SSF_AnyThread) {
    args.Return(Answerer::s_Answer);
}
KORVEL_PUBLISHED(Answerer);

_Socket* Call(unsigned int port) {
    _Socket* socket = Platform::NewSocket(Platform::ST_TCP);
    EXPECT_TRUE(Platform::ConnectSocket(socket, port, kLoopback));
    return socket;
}

class ConnectTest : public testing::Test {
protected:
    ConnectTest() {
        m_Config.m_Flags = SCF_Host | SCF_Standard;
        m_Config.m_AppName = "Tester";
        m_Config.GetApp = [](void*, TagList* tags) -> ScriptObject* {
            return tags && s_Refuses ? nullptr : s_App;
        };
        s_App = m_App.Get();
        s_Refuses = false;
        g_ScriptConfig = nullptr;
        _InitScripting(m_Config);
    }
    // Whatever a test has done: in the end there is no connection, and none is remembered.
    ~ConnectTest() override {
        CleanupScripting();
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
        EXPECT_TRUE(WaitUntil([] { return CountApps() == 0; }));
        g_ScriptConfig = nullptr;
    }

    // Calls over a socket, in which the process does not see that it calls itself.
    static ScriptVal Enter() {
        _Socket* socket = Platform::NewSocket(Platform::ST_TCP);
        Platform::ConnectSocket(socket, GetListenPort(), kLoopback);
        return ScriptApp(socket, "caller", ScriptVal());
    }

    static int CountApps() {
        int count = 0;
        ForEachApp([](void* n, RemoteApp&) { ++*static_cast<int*>(n); }, &count);
        return count;
    }

    static inline ScriptObject* s_App;
    static inline std::atomic<bool> s_Refuses;
    ScriptConfig m_Config;
    ptr<Application> m_App{new Application};
};

TEST_F(ConnectTest, ReadsAndWritesAddresses) {
    struct Case {
        const char* text;
        const char* written;
    };
    // No test asks for a name: a bare machine knows none.
    const Case cases[] = {{"1.2.3.4", "1.2.3.4"},    {" 10 . 0.0 .255 . ", "10.0.0.255"},
                          {"010.0.0.1", "10.0.0.1"}, {"127.0.0.1", "127.0.0.1"},
                          {"", "0.0.0.0"},           {nullptr, "0.0.0.0"}};
    for (const Case& c : cases) {
        char text[16] = "";
        EXPECT_EQ(RemoteApp::StrFromIP(RemoteApp::IPFromStr(c.text), text, sizeof(text)),
                  static_cast<int>(strlen(c.written)));
        EXPECT_STREQ(text, c.written) << (c.text ? c.text : "null");
    }
    char small[4] = "zzz";
    EXPECT_EQ(RemoteApp::StrFromIP(kLoopback, small, sizeof(small)), 3);
    EXPECT_STREQ(small, "127");
    EXPECT_EQ(RemoteApp::StrFromIP(kLoopback, small, 0), 0);
    EXPECT_TRUE(RemoteApp::IsLocalIP("127.0.0.1") && RemoteApp::IsLocalIP(kLoopback));
    EXPECT_FALSE(RemoteApp::IsLocalIP(nullptr));
}

TEST_F(ConnectTest, TellsEachOtherWhoTheyAre) {
    ScriptVal info(SV_Table, nullptr);
    info["Kind"] = "test";
    ASSERT_TRUE(StartScripting(info));
    EXPECT_TRUE(StartScripting(info));
    unsigned int port = GetListenPort();
    EXPECT_GE(port, 49152u);
    EXPECT_TRUE(g_HostInfo["Port"] == port && g_HostInfo["Kind"] == "test");
    EXPECT_TRUE(g_HostInfo["Name"] == "Tester" && g_HostInfo["UUID"] == GetAppUUID());
    // The port is this process's own, so no socket is needed.
    ScriptVal reply;
    ScriptVal root = ScriptApp(kLoopback, port, reply, 60);
    ASSERT_TRUE(root.IsRemoteObject());
    EXPECT_TRUE(reply["Name"] == "Tester" && reply["UUID"] == GetAppUUID());
    RemoteApp* app = root.GetApp();
    EXPECT_EQ(app->GetSocket(), kInProcess);
    EXPECT_STREQ(app->GetName(), "Tester");
    EXPECT_EQ(app->GetIPAddress(), kLoopback);
    EXPECT_TRUE(app->IsUUID(GetAppUUID()));
    EXPECT_TRUE(root.CallMember("Twice", 21) == 42);
    EXPECT_TRUE(root.CallMember("__Login", "user", "password") == true);
    EXPECT_EQ(CountApps(), 2);
    root = SV_Nil;  // the last one who holds it
    EXPECT_TRUE(WaitUntil([] { return CountApps() == 0; }));
}

TEST_F(ConnectTest, GivesAProcessItsDataOnce) {
    ASSERT_TRUE(StartScripting(ScriptVal()));
    ScriptVal data(SV_Table, nullptr);
    data["Task"] = "render";
    g_ProcIDs.Ensure(SV_Table);
    g_ProcIDs[getpid()] = data;
    s_Refuses = true;  // but not those that this process has started
    for (bool isFirst : {true, false}) {
        ScriptVal reply;
        ScriptVal root = ScriptApp(kLoopback, GetListenPort(), reply, 60);
        EXPECT_EQ(root.IsRemoteObject(), isFirst);
        EXPECT_EQ(reply.FindKeyConst("Task") == "render", isFirst);
    }
    EXPECT_EQ(g_ProcIDs.TakeTable(), nullptr);
}

// A host that was to be closed to others must not be open to them by a mistake.
TEST_F(ConnectTest, ListensWhereItIsTold) {
    const std::string noName(64, 'x');  // too long for a name server
    const std::pair<const char*, bool> cases[] = {{"", true},
                                                  {"0.0.0.0", true},
                                                  {"127.0.0.1", true},
                                                  {noName.c_str(), false},
                                                  {"203.0.113.5", false}};  // not of this machine
    for (auto [address, isGood] : cases) {
        Setting setting("KORVEL_ListenAddress", address, "");
        EXPECT_EQ(StartScripting(ScriptVal()), isGood) << address;
        EXPECT_EQ(GetListenPort() != 0, isGood) << address;
        EXPECT_EQ(g_ScriptingActive, isGood);
        StopScripting();
    }
}

TEST_F(ConnectTest, EndsInTimeWhoeverIsThere) {
    ASSERT_TRUE(StartScripting(ScriptVal()));
    constexpr unsigned int kNumSilent = 10;
    _Socket* silent[kNumSilent];
    for (_Socket*& socket : silent) socket = Call(GetListenPort());
    EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == kNumSilent; }));
    auto start = std::chrono::steady_clock::now();
    CleanupScripting();
    std::chrono::duration<double> taken = std::chrono::steady_clock::now() - start;
    EXPECT_LT(taken.count(), kNumSilent / 2) << "each peer may take a second, but at the same time";
    for (_Socket* socket : silent) Platform::DeleteSocket(socket);
}

TEST_F(ConnectTest, RefusesWhomTheHostRefuses) {
    ASSERT_TRUE(StartScripting(ScriptVal()));
    s_Refuses = true;
    ScriptVal reply;
    EXPECT_TRUE(ScriptApp(kLoopback, GetListenPort(), reply, 60).IsNil());
    EXPECT_TRUE(reply.IsNil());
    EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
    // What it has sent behind its introduction is not done.
    static std::atomic<int> numEnded, numAnswered;
    numEnded = numAnswered = 0;
    auto callback = [](void*, RemoteApp*, Packet* answer, uint32_t) {
        if (answer) numAnswered++;
        numEnded++;
        return false;
    };
    {
        ScriptVal root = Enter();
        int numSent = root.AsyncCallMember(callback, nullptr, "__Connect", "name", "uuid", 0);
        EXPECT_EQ(numSent, 1);
        // The end may come in between.
        for (int i = 0; i < 3; i++) numSent += root.AsyncCallMember(callback, nullptr, "Twice", 4);
        EXPECT_TRUE(WaitUntil([&] { return numEnded == numSent && GetNumConnections() == 0; }));
        EXPECT_LE(numAnswered, 1);
    }
    // It can be tried again, on the same connection, too.
    ptr<RemoteApp> app(new RemoteApp("again", 0, nullptr));
    ScriptVal root = app->FindRemoteObject(1);
    EXPECT_FALSE(app->Connect(kLoopback, GetListenPort(), reply));
    s_Refuses = false;
    for (int i = 0; i < 3; i++) {
        EXPECT_TRUE(app->Connect(kLoopback, GetListenPort(), reply));
        EXPECT_TRUE(root.CallMember("Twice", 4) == 8);
    }
    app->_Disconnect(60000);
}

TEST_F(ConnectTest, BelievesNoWrongAnswer) {
    ptr<Answerer> answerer(new Answerer);
    s_App = answerer.Get();
    auto withUUID = [](const ScriptVal& uuid) {
        ScriptVal table(SV_Table, nullptr);
        table["UUID"] = uuid;
        table["Name"] = ("\x1B\xC2\x9B\x7F\n" + std::string(300, 'n')).c_str();
        return table;
    };
    struct Case {
        ScriptVal answer;
        bool isGood;
    };
    const Case cases[] = {{ScriptVal(), false},
                          {5, false},
                          {"text", false},
                          {ScriptVal(SV_Table, nullptr), false},
                          {withUUID(5), false},
                          {withUUID(""), false},
                          {withUUID(std::string(128, 'u').c_str()), false},
                          {withUUID("first"), true},
                          {withUUID("second"), false},  // not the one who was there before
                          {withUUID("first"), true}};
    ptr<RemoteApp> app(new RemoteApp("caller", 0, nullptr));
    app->SetTimeOut(60);
    for (const Case& c : cases) {
        Answerer::s_Answer = c.answer;
        Listener listener;
        ptr<RemoteApp> far;
        std::thread accept(
            [&] { far = ptr<RemoteApp>(new RemoteApp("far", 0, listener.Accept())); });
        ScriptVal reply;
        EXPECT_EQ(app->Connect(kLoopback, listener.m_Port, reply), c.isGood);
        EXPECT_EQ(app->Connected(), c.isGood);
        accept.join();
        if (c.isGood) {
            EXPECT_STREQ(app->GetName(), std::string(127, 'n').c_str());
        }
        app->_Disconnect(60000);
        far->_Disconnect(60000);
    }
    Answerer::s_Answer = SV_Nil;
}

TEST_F(ConnectTest, GivesUpInTime) {
    ScriptVal reply;
    Listener silent;  // the system accepts, nobody answers
    for (double timeOut : {0.05, 0.2}) {
        auto start = std::chrono::steady_clock::now();
        EXPECT_TRUE(ScriptApp(kLoopback, silent.m_Port, reply, timeOut).IsNil());
        std::chrono::duration<double> taken = std::chrono::steady_clock::now() - start;
        EXPECT_GE(taken.count(), timeOut * 0.9);
    }
    EXPECT_FALSE(ScriptApp(silent.Accept(), "caller", ScriptVal()).IsNil());  // it has gone
    // A port of ours at which nobody listens, with a limit and without.
    _Socket* bound = Platform::NewSocket(Platform::ST_TCP);
    EXPECT_TRUE(Platform::BindSocket(bound, 0, kLoopback));
    Platform::_SocketAddress* address = Platform::GetSocketAddress(bound);
    unsigned int port = Platform::SocketAddressGetPort(address);
    Platform::DeleteSocketAddress(address);
    EXPECT_TRUE(ScriptApp(kLoopback, port, reply, 60).IsNil());
    EXPECT_TRUE(ScriptApp(kLoopback, port, reply).IsNil());
    Platform::DeleteSocket(bound);
    for (unsigned int none : {0, 70000}) {
        EXPECT_TRUE(ScriptApp(kLoopback, none, reply).IsNil());
    }
    EXPECT_TRUE(ScriptApp(nullptr, nullptr, ScriptVal()).IsNil());
    EXPECT_TRUE(ScriptApp(Platform::NewSocket(Platform::ST_TCP), nullptr, ScriptVal()).IsNil());
}

TEST_F(ConnectTest, StartsAndStopsWhileOthersCall) {
    ASSERT_TRUE(StartScripting(ScriptVal()));
    ScriptVal reply;
    ScriptVal kept = ScriptApp(kLoopback, GetListenPort(), reply, 60);
    ASSERT_TRUE(kept.IsRemoteObject());
    std::atomic<bool> mustEnd{false};
    std::atomic<int> numAnswers{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < 3; i++) {
        threads.emplace_back([&, i] {
            while (!mustEnd) {
                // One is there already, the others come in.
                ScriptVal root = i ? Enter() : kept;
                numAnswers += root.CallMember("__Connect", "name", "uuid", 0).IsTable();
            }
        });
    }
    ScriptInfo* info = m_App->GetScriptInfo();
    for (int i = 0; i < 20; i++) {
        int before = numAnswers;
        EXPECT_TRUE(WaitUntil([&] { return numAnswers > before + 5; }));
        StopScripting();
        StopScripting();
        EXPECT_EQ(GetListenPort(), 0u);
        EXPECT_FALSE(info->FindSymbol("__Connect", 0) || info->FindSymbol("__Login", 0));
        EXPECT_TRUE(kept.CallMember("Twice", i) == 2 * i);
        EXPECT_TRUE(StartScripting(ScriptVal()));
    }
    mustEnd = true;
    for (std::thread& thread : threads) thread.join();
}

TEST_F(ConnectTest, TellsTheHostOfEachBeginningAndItsEnd) {
    static std::atomic<int> numBegun, numEnded;
    static KorvelScript::Lock uiLock;
    numBegun = numEnded = 0;
    m_Config.OnConnect = [](void*, RemoteApp*, TagList*) { numBegun++; };
    m_Config.OnDisconnect = [](void*, RemoteApp*, TagList*) {
        EXPECT_LT(numEnded, numBegun);
        numEnded++;
    };
    m_Config.UIExecute = [](ScriptConfig::UIFunction function, void* a, void* b, bool) {
        KorvelScript::AutoLock guard(uiLock);
        return function(a, b);
    };
    ASSERT_TRUE(StartScripting(ScriptVal()));
    for (int i = 0; i < 100; i++) Platform::DeleteSocket(Call(GetListenPort()));
    EXPECT_TRUE(Enter().IsRemoteObject());
    EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0 && CountApps() == 0; }));
    EXPECT_GE(numBegun, 2);
    EXPECT_EQ(numBegun, numEnded);
}

TEST_F(ConnectTest, TurnsCallersAwayWithoutDescriptors) {
    ASSERT_TRUE(StartScripting(ScriptVal()));
    _Socket* callers[3];
    for (_Socket*& caller : callers) caller = Platform::NewSocket(Platform::ST_TCP);
    rlimit old;
    getrlimit(RLIMIT_NOFILE, &old);
    int lowest = dup(0);
    close(lowest);
    rlimit limit = {static_cast<rlim_t>(lowest), old.rlim_max};
    setrlimit(RLIMIT_NOFILE, &limit);
    for (_Socket* caller : callers) {
        EXPECT_TRUE(Platform::ConnectSocket(caller, GetListenPort(), kLoopback));
        char byte;
        EXPECT_EQ(Platform::SocketReceive(caller, &byte, 1, nullptr, nullptr), 0);
    }
    setrlimit(RLIMIT_NOFILE, &old);
    for (_Socket* caller : callers) Platform::DeleteSocket(caller);
    ScriptVal reply;
    EXPECT_TRUE(ScriptApp(kLoopback, GetListenPort(), reply, 60).IsRemoteObject());
}

TEST_F(ConnectTest, WorksWithAHostInAnotherProcess) {
    HostProcess host(MEDIAHOST);
    ScriptVal reply;
    ScriptVal root = ScriptApp(kLoopback, host.GetPort(), reply, 60);
    ASSERT_TRUE(root.IsRemoteObject());
    EXPECT_TRUE(reply["Name"] == "MediaHost" && reply["UUID"] != GetAppUUID());
    EXPECT_STREQ(root.GetApp()->GetName(), "MediaHost");
    EXPECT_STREQ(root.GetApp()->GetHostName(), "127.0.0.1");
    EXPECT_TRUE(root.CallMember("ClassName").IsNil());  // a variable is not called
    EXPECT_EQ(host.End(SIGTERM), 0);
    EXPECT_TRUE(WaitUntil([&] { return !root.GetApp()->Connected(); }));

    HostProcess other(MEDIAHOST);
    EXPECT_FALSE(root.GetApp()->Connect(kLoopback, other.GetPort(), reply)) << "it is another one";
    EXPECT_TRUE(root.GetApp()->ClearUUID());
    EXPECT_TRUE(root.GetApp()->Connect(kLoopback, other.GetPort(), reply));
    other.End(SIGKILL);
    EXPECT_TRUE(root.CallMember("Render").IsNil());
}

}  // namespace
}  // namespace Korvel

// Connecting by name: a script server is asked, here one that the test plays, then the host.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <cmath>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Platform/NetworkingInternal.h"
#include "Platform/Threads.h"
#include "RemoteFixture.h"
#include "remote/ConnectApp.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptPortInternal.h"
#include "remote/ScriptServer.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;

// The application's object, which also plays the script server.
class Home : public Scripted<_Object> {
    KORVEL_SCRIPTED(Home)
public:
    Home() { SetScriptClass(); }
    void IncRef() override { m_Count++; }
    void DecRef() override { m_Count--; }

    std::atomic<int> m_Count{0};
    std::mutex m_Mutex;
    ScriptVal m_Info;   // what FindHost tells
    ScriptVal m_Asked;  // its last arguments
    std::atomic<int> m_NumAsked{0};
};
KORVEL_PUBLISH(Home, "Home", "", "")
KORVEL_FUNCTION(Home, Twice, SSF_AnyThread) {
    args.ReturnNumber(2 * args[1].ToNumber());
}
KORVEL_FUNCTION(Home, FindHost, SSF_AnyThread) {
    std::lock_guard guard(self.m_Mutex);
    self.m_NumAsked++;
    self.m_Asked = ScriptVal(SV_Table, nullptr);
    for (int i = 1; i <= 3; i++) self.m_Asked[i] = args[i];
    args.Return(self.m_Info);
}
KORVEL_FUNCTION(Home, GetTorvane, SSF_AnyThread) {
    args.ReturnString("its object");
}
KORVEL_PUBLISHED(Home);

// Accepts whoever calls, as a host does, at a port of its own.
class Service {
public:
    Service()
        : m_Thread([this] {
              Platform::_Socket* socket;
              while ((socket = m_Listener.Accept()) != Platform::kNoSocket) AcceptListen(socket);
          }) {}
    Service(const Service&) = delete;
    Service& operator=(const Service&) = delete;
    ~Service() {
        Platform::ShutdownSocket(m_Listener.m_Socket, 3);
        m_Thread.join();
    }
    unsigned int GetPort() const { return m_Listener.m_Port; }

private:
    Listener m_Listener;
    std::thread m_Thread;
};

class ByName : public testing::Test {
protected:
    ByName() {
        s_Home = &m_Home;
        m_Config.m_Flags = SCF_Host | SCF_Standard;
        m_Config.m_AppName = "Tester";
        m_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_Home; };
        g_ScriptConfig = nullptr;
        _InitScripting(m_Config);
        g_ScriptServerPort = m_Server.GetPort();
        m_Home.m_Info = GetInfo(m_Host.GetPort(), GetAppUUID());
    }
    ~ByName() override {
        CleanupScripting();
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0 && CountApps() == 0; }));
        EXPECT_TRUE(WaitUntil([this] { return m_Home.m_Count == 0; }));
        g_ScriptConfig = nullptr;
        g_ScriptServerPort = m_OldPort;
    }

    // As a host that finds no server to register with.
    static void Start() {
        const unsigned int port = std::exchange(g_ScriptServerPort, Listener().m_Port);
        ASSERT_TRUE(StartScripting(ScriptVal()));
        g_ScriptServerPort = port;
    }
    static int CountApps() {
        int count = 0;
        ForEachApp([](void* n, RemoteApp&) { ++*static_cast<int*>(n); }, &count);
        return count;
    }
    static ScriptVal GetInfo(const ScriptVal& port, const ScriptVal& uuid) {
        ScriptVal info(SV_Table, nullptr);
        info["Port"] = port;
        info["UUID"] = uuid;
        return info;
    }
    // Not waiting for scripting in this process.
    static ScriptVal Connect(const char* name, const ScriptVal& uuid = {}) {
        return ScriptApp(name, nullptr, uuid, "127.0.0.1", 60);
    }

    static inline Home* s_Home;
    Setting m_Again{"KORVEL_RegisterAgainSeconds", "3600", "10"};
    const unsigned int m_OldPort = g_ScriptServerPort;
    ScriptConfig m_Config;
    Home m_Home;
    Service m_Server, m_Host;
};

TEST_F(ByName, FindsAHostByWhatItIs) {
    Start();
    struct Case {
        const char* name;
        const char* subtype;
        const char* asked;
        const char* askedSubtype;
        bool isObject;
    };
    const std::string longName(200, 'n'), cutName(127, 'n');
    const Case cases[] = {
        {"!Tester", nullptr, "Tester", nullptr, true},
        {"Tester", "", "Tester", nullptr, true},
        {"Tester", "Key", "Tester", "Key", true},
        {longName.c_str(), longName.c_str(), cutName.c_str(), cutName.c_str(), true},
        {"!Torvane", "Key", "Korvel", "Torvane", false}};
    for (const Case& c : cases) {
        ScriptVal root = ScriptApp(c.name, c.subtype, ScriptVal(), "127.0.0.1", 60);
        EXPECT_TRUE(m_Home.m_Asked[1] == c.asked && m_Home.m_Asked[2].IsNil()) << c.name;
        EXPECT_TRUE(m_Home.m_Asked[3] == ScriptVal(c.askedSubtype)) << c.name;
        EXPECT_EQ(root.IsRemoteObject(), c.isObject) << c.name;
        if (!c.isObject) {
            EXPECT_TRUE(root == "its object");
            continue;
        }
        EXPECT_TRUE(root.CallMember("Twice", 21) == 42);
        RemoteApp* app = root.GetApp();
        EXPECT_STREQ(app->GetName(), "Tester");
        EXPECT_STREQ(app->GetHostName(), "127.0.0.1");
        EXPECT_TRUE(app->IsUUID(GetAppUUID()) && app->GetIPAddress() == kLoopback);
        EXPECT_EQ(app->GetTimeOut(), 60);
        EXPECT_TRUE(g_HasBeenConnected && GetNumConnections() > 0);
    }
    // The server itself, which is not asked for a host, nor who it is.
    int before = m_Home.m_NumAsked;
    for (const char* name : {"!", "", static_cast<const char*>(nullptr)}) {
        ScriptVal root = ScriptApp(name, nullptr, ScriptVal(), "127.0.0.1", 60);
        EXPECT_TRUE(root.CallMember("Twice", 3) == 6);
        EXPECT_TRUE(root.GetApp()->GetUUID().IsNil());
    }
    EXPECT_EQ(m_Home.m_NumAsked, before);
    EXPECT_TRUE(ScriptLogin("127.0.0.1", "Tester", "user", "password"));
}

// What this process is called by its UUID needs neither a server nor a socket.
TEST_F(ByName, KnowsItself) {
    Start();
    ScriptVal root = Connect("whatever", GetAppUUID());
    ASSERT_TRUE(root.IsRemoteObject());
    EXPECT_EQ(root.GetApp()->GetSocket(), kInProcess);
    EXPECT_TRUE(root.CallMember("Twice", 4) == 8);
    EXPECT_EQ(m_Home.m_NumAsked, 0);
}

TEST_F(ByName, WaitsForScripting) {
    std::atomic<bool> isBack{false};
    std::atomic<pid_t> thread{0};
    std::thread waiter([&] {
        thread = gettid();
        EXPECT_TRUE(Connect("").IsRemoteObject());
        isBack = true;
    });
    EXPECT_TRUE(WaitUntil([&] { return thread && IsAsleep(thread); }));
    EXPECT_TRUE(Connect("!").IsRemoteObject()) << "which does not wait";
    EXPECT_TRUE(!isBack && m_Home.m_NumAsked == 0);
    m_Config.m_Flags = SCF_Standard;  // a client has nothing to wait for itself
    EXPECT_TRUE(StartScripting(ScriptVal()));
    waiter.join();
}

TEST_F(ByName, CanBeTriedAgain) {
    Start();
    unsigned int port = m_Host.GetPort();
    const ScriptVal good = m_Home.m_Info;
    unsigned int deadPort;
    { deadPort = Listener().m_Port; }
    const ScriptVal cases[] = {{},
                               5,
                               "text",
                               ScriptVal(SV_Table, nullptr),
                               GetInfo(0, GetAppUUID()),
                               GetInfo(-5, GetAppUUID()),
                               GetInfo(65536, GetAppUUID()),
                               GetInfo(NAN, GetAppUUID()),
                               GetInfo("1", GetAppUUID()),
                               GetInfo(deadPort, GetAppUUID()),
                               GetInfo(port, "another")};
    auto app = ptr<RemoteApp>(new RemoteApp("", 0, nullptr));
    ScriptVal root = app->FindRemoteObject(1);
    int i = 0;
    for (const ScriptVal& info : cases) {
        SCOPED_TRACE(i++);
        m_Home.m_Info = info;
        EXPECT_TRUE(Connect("Tester").IsNil());
        m_Home.m_Info = good;
        EXPECT_TRUE(Connect("Tester").IsRemoteObject());
    }
    // The same object: what a wrong server has told is forgotten, and nothing stays counted.
    for (const ScriptVal& info : {GetInfo(port, "another"), GetInfo(deadPort, "another")}) {
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
        ScriptVal async = AsyncScriptApp("Tester", nullptr, ScriptVal(), "127.0.0.1", 60, false);
        RemoteApp* made = async.GetApp();
        m_Home.m_Info = info;
        EXPECT_FALSE(made->Connect() || made->Connect());
        EXPECT_TRUE(made->GetUUID().IsNil());
        app = ptr<RemoteApp>();
        root = SV_Nil;
        EXPECT_TRUE(WaitUntil([this] { return m_Home.m_Count == 0; }));
        m_Home.m_Info = good;
        for (int n = 0; n < 3; n++) {
            EXPECT_TRUE(made->Connect());
            EXPECT_TRUE(async.CallMember("Twice", n) == 2 * n);
        }
    }
    g_ScriptServerPort = deadPort;
    EXPECT_TRUE(Connect("Tester").IsNil());
    for (const char* host : {"", "0.0.0.0", static_cast<const char*>(nullptr)}) {
        EXPECT_TRUE(ScriptApp("!Tester", nullptr, ScriptVal(), host, 60).IsNil());
    }
    EXPECT_TRUE(Connect("Tester", "no such process").IsNil());
}

// A server that answers, but does not let go.
TEST_F(ByName, LeavesTheServerFirst) {
    Listener server;
    g_ScriptServerPort = server.m_Port;
    std::atomic<bool> isOver{false};
    std::thread play([&] {
        Bare peer;
        peer.Close();
        peer.m_Socket = server.Accept();
        Packet* packet = peer.Receive();
        ScriptVal answer(SV_Table, nullptr);
        answer[-1] = m_Home.m_Info;
        peer.Send(CreateReply(packet, nullptr, nullptr, &answer));
        FreePkt(packet);
        EXPECT_TRUE(WaitUntil([&] { return isOver.load(); }));
    });
    EXPECT_TRUE(Connect("!Tester").IsNil());
    isOver = true;
    play.join();
}

// The host whose UI thread is any.
class AsyncByName : public ByName {
protected:
    AsyncByName() {
        s_NumConnects = s_NumFailures = 0;
        m_Config.UIExecute = [](ScriptConfig::UIFunction function, void* a, void* b, bool) {
            std::lock_guard guard(s_UILock);
            return function(a, b);
        };
        m_Config.OnConnect = [](void*, RemoteApp*, TagList*) { s_NumConnects++; };
        m_Config.OnConnectFailed = [](void*, RemoteApp*, TagList*) { s_NumFailures++; };
    }
    static inline std::recursive_mutex s_UILock;
    static inline std::atomic<int> s_NumConnects, s_NumFailures;
};

TEST_F(AsyncByName, TellsTheHostHowItEnds) {
    Start();
    const ScriptVal good = m_Home.m_Info;
    ScriptVal root = AsyncScriptApp("Tester", "Key", ScriptVal(), "127.0.0.1", 60, true);
    ASSERT_TRUE(root.IsRemoteObject());
    EXPECT_TRUE(WaitUntil([&] { return root.CallMember("Twice", 2) == 4; }));
    EXPECT_TRUE(WaitUntil([] { return s_NumConnects >= 1; }));
    m_Home.m_Info = SV_Nil;
    root = AsyncScriptApp("Tester", nullptr, ScriptVal(), "127.0.0.1", 60, true);
    EXPECT_TRUE(WaitUntil([] { return s_NumFailures == 1; }));
    m_Home.m_Info = good;
    EXPECT_TRUE(root.GetApp()->AsyncConnect());
    EXPECT_TRUE(WaitUntil([&] { return root.CallMember("Twice", 2) == 4; }));
    // Nobody else holds it: its thread does.
    AsyncScriptApp("Tester", nullptr, ScriptVal(), "127.0.0.1", 60, true);
}

// Neither a server that says nothing nor a machine that does not answer holds up the end.
TEST_F(AsyncByName, IsCancelledAtTheEnd) {
    Start();
    Listener silent;
    Listener full;
    listen(Platform::SocketDescriptor(full.m_Socket), 0);
    std::vector<Platform::_Socket*> callers;
    for (int i = 0; i < 3; i++) {  // one or two fill the queue
        callers.push_back(Platform::NewSocket(Platform::ST_TCP));
        Platform::SetSocketNonBlocking(callers.back(), true);
        Platform::ConnectSocket(callers.back(), full.m_Port, kLoopback);
    }
    ScriptVal roots[2];
    const Listener* servers[] = {&silent, &full};
    for (int i = 0; i < 2; i++) {
        g_ScriptServerPort = servers[i]->m_Port;
        roots[i] = AsyncScriptApp("Tester", nullptr, ScriptVal(), "127.0.0.1", 0, true);
        RemoteApp* app = roots[i].GetApp();
        EXPECT_TRUE(WaitUntil([&] { return GetNumConnections() == 1; }));
        EXPECT_FALSE(app->Connected()) << "with the server, but not with a host";
        EXPECT_FALSE(app->AsyncConnect() || app->Connect()) << "another thread does";
    }
    CleanupScripting();
    EXPECT_FALSE(roots[0].GetApp()->Connected() || roots[1].GetApp()->Connected());
    EXPECT_TRUE(AwaitConnecting(1)) << "the threads have ended";
    for (Platform::_Socket* caller : callers) Platform::DeleteSocket(caller);
}

TEST_F(ByName, LeaksNothing) {
    Start();
    auto connect = [&](int count) {
        for (int i = 0; i < count; i++) {
            m_Home.m_Info = GetInfo(i % 10 ? m_Host.GetPort() : 0, GetAppUUID());
            ScriptVal root = Connect("Tester");
            EXPECT_EQ(root.CallMember("Twice", i) == 2 * i, i % 10 != 0);
        }
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0 && CountApps() == 0; }));
        EXPECT_TRUE(WaitUntil([&] { return m_Home.m_Count == 0; }));
    };
    connect(20);
    int numDescriptors = CountDescriptors();
    connect(200);
    EXPECT_TRUE(WaitUntil([&] { return CountDescriptors() == numDescriptors; }));
}

}  // namespace
}  // namespace Korvel

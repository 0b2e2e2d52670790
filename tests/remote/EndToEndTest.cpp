// Script servers, hosts and clients find each other: each a process, with a server of the test's
// own.
#include <gtest/gtest.h>
#include <unistd.h>

#include <climits>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
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

// A sanitizer's malloc keeps what has been freed for a while.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kIsSanitized = true;
#else
constexpr bool kIsSanitized = false;
#endif

constexpr char kPython[] = "/usr/bin/python3";
constexpr char kThisMachine[] = "127.0.0.1";

// What this process publishes.
class Doubler : public Scripted<RefObject> {
    KORVEL_SCRIPTED(Doubler)
public:
    Doubler() { SetScriptClass(); }
};
KORVEL_PUBLISH(Doubler, "Doubler", "", "")
KORVEL_FUNCTION(Doubler, Twice, SSF_AnyThread) {
    args.ReturnNumber(2 * args[1].ToNumber());
}
KORVEL_PUBLISHED(Doubler);

ScriptVal Find(const char* name, const char* subtype = nullptr) {
    return ScriptApp(name, subtype, ScriptVal(), kThisMachine, kLimitMs / 1000);
}

// The process of the MediaHost that is found, 0 for none.
double FindProcess(const char* subtype = nullptr) {
    ScriptVal host = Find("!MediaHost", subtype);
    if (host.IsNil()) return 0;
    ScriptVal server = Find(nullptr);
    return server.CallMember("FindHost", "MediaHost", host.GetApp()->GetUUID())["ProcessID"]
        .ToNumber();
}

uint32_t CountHosts() {
    return Find(nullptr).CallMember("GetHostList").NumKeys();
}

int CountEntries(const std::string& folder) {
    namespace fs = std::filesystem;
    return static_cast<int>(std::distance(fs::directory_iterator(folder), {}));
}

// What another process has open, and how much memory it uses.
struct Usage {
    explicit Usage(pid_t process) {
        std::string folder = "/proc/" + std::to_string(process);
        m_NumDescriptors = CountEntries(folder + "/fd");
        m_NumThreads = CountEntries(folder + "/task");
        long pages = 0;
        std::ifstream(folder + "/statm") >> pages >> pages;
        m_NumBytes = pages * sysconf(_SC_PAGESIZE);
    }
    int m_NumDescriptors, m_NumThreads;
    long m_NumBytes;
};

class EndToEndTest : public testing::Test {
protected:
    EndToEndTest() {
        s_App = m_App.Get();
        m_Config.m_AppName = "Tester";
        m_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_App; };
        _InitScripting(m_Config);
        StartScripting(ScriptVal());
    }
    ~EndToEndTest() override {
        CleanupScripting();
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
        EXPECT_TRUE(WaitUntil([&] { return m_App->GetUseCount() == 1; }));
        g_ScriptConfig = nullptr;
    }

    // Who looks for it by a connection keeps it alive.
    static void AwaitServerEnd() {
        EXPECT_TRUE(
            WaitUntil([] { return ServerProcess(g_ScriptServerPort).AwaitLine("Started"); }));
    }

    static inline ScriptObject* s_App;
    const ServerTool m_Tool{OXSCRIPT};
    const Setting m_Again{"KORVEL_RegisterAgainSeconds", "0", "10"};
    ScriptConfig m_Config;
    ptr<Doubler> m_App{new Doubler};
};

TEST_F(EndToEndTest, AHostIsKilled) {
    ServerProcess server(g_ScriptServerPort);
    ASSERT_TRUE(server.AwaitLine("Started"));
    HostProcess plain(MEDIAHOST), low(MEDIAHOST, "--priority", "1");
    HostProcess high(MEDIAHOST, "--priority", "2");
    double plainProcess = FindProcess();
    double highProcess = FindProcess("render");
    EXPECT_TRUE(plainProcess && highProcess && plainProcess != highProcess);
    ScriptVal kept = Find("!MediaHost", "render");
    EXPECT_EQ(CountHosts(), 3u);

    EXPECT_EQ(high.End(SIGKILL), -1 - SIGKILL);
    EXPECT_TRUE(WaitUntil([] { return CountHosts() == 2; }));
    EXPECT_TRUE(server.AwaitLine("Host 'MediaHost' Killed\n"));
    double lowProcess = FindProcess("render");
    EXPECT_TRUE(lowProcess && lowProcess != plainProcess && lowProcess != highProcess);
    low.End(SIGKILL);
    EXPECT_TRUE(server.AwaitLine("Host 'MediaHost' Killed\n"));
    EXPECT_TRUE(Find("!MediaHost", "render").IsNil()) << "none is left that has a priority";
    EXPECT_EQ(FindProcess(), plainProcess);

    // Whoever held the one that is gone finds another one, on the same connection.
    EXPECT_TRUE(WaitUntil([&] { return !kept.GetApp()->Connected(); }));
    EXPECT_FALSE(kept.GetApp()->Connect()) << "it is not the one that it was";
    HostProcess again(MEDIAHOST, "--priority", "3");
    kept.GetApp()->ClearUUID();
    EXPECT_TRUE(kept.GetApp()->Connect());
    EXPECT_TRUE(kept.CallMember("GetPingInfo")["Title"] == "Untitled");
}

TEST_F(EndToEndTest, AClientIsKilled) {
    ServerProcess server(g_ScriptServerPort);
    ASSERT_TRUE(server.AwaitLine("Started"));
    HostProcess host(MEDIAHOST, "--debug");
    auto countUses = [] {
        return Find("!MediaHost").CallMember("CountUses").FindKeyConst("UseCount").ToNumber();
    };
    double numUses = countUses();
    EXPECT_GT(numUses, 0);
    // It has a timeline of the host, and one connection with each.
    HostProcess client(OXSCRIPT, "-e",
                       "timeline = orv.scriptapp('MediaHost', nil, 60).Timeline "
                       "server = orv.scriptapp() server:AddHost { Name = 'Client' } print(1) "
                       "io.flush() orv.wait(1000)");
    EXPECT_EQ(client.GetPort(), 1u);
    EXPECT_GT(countUses(), numUses);
    EXPECT_EQ(CountHosts(), 2u);
    EXPECT_EQ(client.End(SIGKILL), -1 - SIGKILL);
    EXPECT_TRUE(server.AwaitLine("Host 'Client' Killed\n"));
    EXPECT_TRUE(WaitUntil([&] { return countUses() == numUses; })) << countUses();
}

// All hosts find out at the same time, and start one server between them.
TEST_F(EndToEndTest, TheServerIsKilled) {
    std::vector<std::unique_ptr<HostProcess>> hosts;
    auto server = std::make_unique<ServerProcess>(g_ScriptServerPort);
    ASSERT_TRUE(server->AwaitLine("Started"));
    for (int i = 0; i < 3; i++) hosts.push_back(std::make_unique<HostProcess>(MEDIAHOST));
    ScriptVal kept = Find("!MediaHost");
    EXPECT_EQ(CountHosts(), 3u);
    server.reset();
    EXPECT_TRUE(kept.CallMember("GetPingInfo").IsTable()) << "who is connected does not mind";
    EXPECT_TRUE(WaitUntil([] { return CountHosts() == 3; }));
    EXPECT_NE(FindProcess(), 0);

    // It leaves with the last of them, and its place is free.
    kept = SV_Nil;
    for (auto& host : hosts) EXPECT_EQ(host->End(SIGTERM), 0);
    AwaitServerEnd();
}

TEST_F(EndToEndTest, ManyServersStartAtOnce) {
    std::vector<std::unique_ptr<ServerProcess>> servers;
    for (int i = 0; i < 6; i++) {
        servers.push_back(std::make_unique<ServerProcess>(g_ScriptServerPort, "4294967295"));
    }
    int numStarted = 0;
    for (auto& server : servers) {
        bool isStarted = server->AwaitLine("Started");
        numStarted += isStarted;
        if (isStarted) continue;
        EXPECT_EQ(server->AwaitEnd(), 0);
    }
    EXPECT_EQ(numStarted, 1);
    EXPECT_EQ(CountHosts(), 0u);
}

// Each process starts a server, and all hosts are with the same one.
TEST_F(EndToEndTest, ManyHostsStartAtOnce) {
    std::vector<std::unique_ptr<HostProcess>> hosts(5);
    std::vector<std::thread> starts;
    for (auto& host : hosts) {
        starts.emplace_back([&host] { host = std::make_unique<HostProcess>(MEDIAHOST); });
    }
    for (std::thread& start : starts) start.join();
    EXPECT_EQ(CountHosts(), hosts.size());
    for (auto& host : hosts) EXPECT_EQ(host->End(SIGTERM), 0);
    AwaitServerEnd();
}

// KORVEL_CONNECTS is their number; 1000 show what 200 may hide.
TEST_F(EndToEndTest, ConnectingLeavesNothingBehind) {
    constexpr size_t kMostGrowth = 256 * 1024;
    constexpr long kMostForeignGrowth = kIsSanitized ? LONG_MAX / 2 : 1024 * 1024;
    const char* setting = getenv("KORVEL_CONNECTS");
    int numConnects = setting ? atoi(setting) : 200;
    ServerProcess server(g_ScriptServerPort, "4294967295");
    ASSERT_TRUE(server.AwaitLine("Started"));
    HostProcess host(MEDIAHOST, "--debug");
    auto connect = [](int count) {
        for (int i = 0; i < count; i++) {
            ScriptVal root = Find(i % 2 ? "MediaHost" : "!MediaHost");
            if (i % 10 == 0) {
                EXPECT_TRUE(root.CallMember("Clip", "Intro", 5).IsRemoteObject());
            } else {
                EXPECT_TRUE(root.CallMember("GetPingInfo").IsTable());
            }
        }
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
    };
    connect(numConnects / 4);
    auto hostProcess = static_cast<pid_t>(FindProcess());
    const pid_t processes[] = {server.GetProcess(), hostProcess};
    connect(1);
    std::vector<Usage> before(std::begin(processes), std::end(processes));
    int numDescriptors = CountDescriptors();
    size_t numBytes = CountBytes();
    connect(numConnects);
    EXPECT_TRUE(WaitUntil([&] { return CountDescriptors() <= numDescriptors; }));
    EXPECT_LT(CountBytes(), numBytes + kMostGrowth);
    for (size_t i = 0; i < before.size(); i++) {
        // A connection's end there may come a moment later.
        EXPECT_TRUE(WaitUntil([&] {
            Usage now(processes[i]);
            return now.m_NumDescriptors <= before[i].m_NumDescriptors &&
                   now.m_NumThreads <= before[i].m_NumThreads;
        })) << i;
        EXPECT_LT(Usage(processes[i]).m_NumBytes, before[i].m_NumBytes + kMostForeignGrowth) << i;
    }
    EXPECT_EQ(CountHosts(), 1u);
}

// Peers of another make

class PythonTest : public EndToEndTest {
protected:
    ~PythonTest() override { AwaitEnd(); }
    void Play(const char* part) {
        m_Thread = std::thread([=, this] {
            std::string port = std::to_string(g_ScriptServerPort);
            m_Result = RunProcess({kPython, PEER_SCRIPT, part, port});
        });
    }

    void AwaitEnd() {
        if (!m_Thread.joinable()) return;
        m_Thread.join();
        EXPECT_EQ(m_Result.m_Out + m_Result.m_Err, "ok\n");
    }

private:
    std::thread m_Thread;
    ProcessResult m_Result;
};

TEST_F(PythonTest, IsAClient) {
    ServerProcess server(g_ScriptServerPort);
    ASSERT_TRUE(server.AwaitLine("Started"));
    HostProcess host(MEDIAHOST);
    Play("client");
    AwaitEnd();
    EXPECT_TRUE(Find("!MediaHost").CallMember("GetPingInfo")["Title"] == "By hand");
}

TEST_F(PythonTest, IsAHost) {
    ServerProcess server(g_ScriptServerPort);
    ASSERT_TRUE(server.AwaitLine("Started"));
    Play("host");
    ASSERT_TRUE(server.AwaitLine("Host 'Python' ["));
    // The server has asked it how it is.
    EXPECT_TRUE(WaitUntil([&] {
        return server.Ask("SPP:Python").find("Title = \"Asked for\"") != std::string::npos;
    }));
    ProcessResult script =
        RunProcess({OXSCRIPT, "--host", "Python", "-e", "print(app:Twice(21), app:Twice(4))"});
    EXPECT_EQ(script.m_Out + script.m_Err, "42\t8\n");
    ScriptVal root = Find("Python");
    ASSERT_TRUE(root.IsRemoteObject());
    EXPECT_STREQ(root.GetApp()->GetName(), "Python");
    EXPECT_TRUE(root.CallMember("TwiceThere", 21) == 42) << "calls this process meanwhile";
    EXPECT_TRUE(Find("Python").CallMember("Twice", 3) == 6);
    root.CallMember("Quit");
    EXPECT_TRUE(server.AwaitLine("Host 'Python' Removed\n"));
    root = SV_Nil;
    EXPECT_TRUE(server.AwaitLine("Terminated\n")) << "it has left as a peer should";
}

TEST_F(PythonTest, AnswersDatagrams) {
    Play("answer");
    ScriptVal answers;
    EXPECT_TRUE(
        WaitUntil([&] { return Ping("Film", 0.1, answers, kLoopback) && answers.NumKeys() > 0; }));
    EXPECT_TRUE(answers[1]["Type"] == "Film" && answers[1]["IP"] == kThisMachine);
    EXPECT_TRUE(answers[1]["List"][2] == 2.5 && answers[1]["List"][3] == "three");
}

// Other machines

TEST_F(EndToEndTest, HostsOfAnotherMachineAreFound) {
    ProcessResult result = RunProcess({"sh", UNSHARE_SCRIPT});
    if (result.m_Status != 0) GTEST_SKIP() << "no networks of our own: " << result.m_Err;
    TempDir dir;
    std::string script = dir.Write("find.lua", R"(
        local stop, hosts = orv.gettime() + 60
        repeat
            hosts = orv.pinghosts("MediaHost", 0.1)
        until hosts[1] or orv.gettime() > stop
        local app = orv.scriptapp("MediaHost", hosts[1].IP, 60)
        print(#hosts, hosts[1].IP, hosts[1].Type, app.ClassName, app:GetPingInfo().Title)
        local server = orv.scriptapp(nil, hosts[1].IP, 60)
        print(server:StartHost("Not", "/bin/true"), (server:StartHost("MediaHost", "/bin/true")))
        print(orv.scriptapp("MediaHost", nil, 60), orv.scriptapp("MediaHost", "10.77.0.1", 60))
    )");
    // Where hosts listen at every address, as they do by themselves.
    Setting anywhere("KORVEL_ListenAddress", "", "");
    for (std::string mayStart : {"false", "true"}) {
        Setting allow("KORVEL_AllowRemoteStart", mayStart.c_str(), "false");
        result = RunProcess({"sh", UNSHARE_SCRIPT, MEDIAHOST, OXSCRIPT, script});
        EXPECT_EQ(result.m_Out, "1\t10.77.0.2\tMediaHost\tMediaHost\tUntitled\n" + mayStart +
                                    "\ttrue\nnil\tnil\n")
            << result.m_Err;
    }
}

}  // namespace
}  // namespace Korvel

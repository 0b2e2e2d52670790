// The script server as others see it: a real one, and hosts and clients of this process.
#include "remote/ScriptServer.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <csignal>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Platform/Threads.h"
#include "ServerFixture.h"
#include "remote/ServerDiscoveryInternal.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;
using Platform::_Socket;

// What hosts publish here.
class PlayedHost : public Scripted<RefObject> {
    KORVEL_SCRIPTED(PlayedHost)
public:
    PlayedHost() { SetScriptClass(); }
    void IncRef() override { Use(); }
    void DecRef() override { Recycle(); }
    static inline ScriptVal s_PingInfo;
    static inline std::atomic<int> s_Told{0};
};
KORVEL_PUBLISH(PlayedHost, "PlayedHost", "", "")
KORVEL_FUNCTION(PlayedHost, GetPingInfo, SSF_AnyThread) {
    args.Return(PlayedHost::s_PingInfo);
}
KORVEL_FUNCTION(PlayedHost, Tell, SSF_AnyThread) {
    PlayedHost::s_Told += static_cast<int>(args[1].ToNumber());
}
KORVEL_PUBLISHED(PlayedHost);

class ScriptServerTest : public testing::Test {
protected:
    ScriptServerTest() {
        s_Host = m_Host.Get();
        s_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_Host; };
        g_ScriptConfig = &s_Config;
        PlayedHost::s_PingInfo = SV_Nil;
        PlayedHost::s_Told = 0;
    }
    ~ScriptServerTest() override {
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
        EXPECT_TRUE(WaitUntil([&] { return m_Host->GetUseCount() == 1; }));
        g_ScriptConfig = nullptr;
    }

    static std::string Names(const ScriptVal& list) {
        std::string names;
        for (TableEntry* entry = nullptr; list.NextKey(entry);) {
            names.append(entry->m_Value["Name"].ToString("?")).append(" ");
        }
        return names;
    }

    static inline ScriptObject* s_Host;
    static inline ScriptConfig s_Config;  // threads of connections may look at it once more
    ptr<PlayedHost> m_Host{new PlayedHost};
};

TEST_F(ScriptServerTest, KnowsItsHosts) {
    ServerProcess process;
    ASSERT_TRUE(process.AwaitLine("Started"));
    ScriptVal server = process.Connect();
    std::string help = server.CallMember("GetHelp", "ScriptServer").ToString("");
    for (const char* name : {"AddHost", "RemoveHost", "FindHost", "GetHostList", "StartHost",
                             "NotifyHosts", "Connect"}) {
        EXPECT_NE(help.find(name), std::string::npos) << name << help;
    }
    EXPECT_EQ(help.find("PktTest"), std::string::npos);

    // What is no host.
    for (const ScriptVal& info :
         {ScriptVal(), ScriptVal("Name"), Table({}), Table({{"Name", 5}}),
          Table({{"Name", "Large"}, {"Text", std::string(70000, 'x').c_str()}})}) {
        EXPECT_TRUE(server.CallMember("AddHost", info) == false);
    }
    EXPECT_TRUE(server.CallMember("AddHost", Table({{"Name", "A\x1b[1m"}, {"ProcessID", 7}})) ==
                true);
    EXPECT_TRUE(process.AwaitLine("Host 'A[1m' [7] Added\n")) << "terminals obey what is printed";
    server.CallMember("AddHost", Table({{"Name", "B"}, {"ProcessID", "seven"}, {"Port", "x"}}));
    EXPECT_TRUE(process.AwaitLine("Host 'B' [0] Added\n"));
    server.CallMember("AddHost", Table({{"Name", "B"}, {"ProcessID", 7}, {"Own", "kept"}}));
    EXPECT_EQ(Names(server.CallMember("GetHostList")), "A\x1b[1m B B ");

    EXPECT_TRUE(server.CallMember("RemoveHost", "7") == false);
    EXPECT_TRUE(server.CallMember("RemoveHost", 8) == false);
    EXPECT_TRUE(server.CallMember("RemoveHost", -1) == false);
    EXPECT_TRUE(server.CallMember("RemoveHost", 0) == true);
    EXPECT_TRUE(process.AwaitLine("Host 'B' Removed\n"));
    EXPECT_TRUE(server.CallMember("RemoveHost", 7) == true);
    EXPECT_TRUE(process.AwaitLine("Host 'A[1m' Removed\n")) << "the older one of the process";
    EXPECT_TRUE(server.CallMember("FindHost", "B")["Own"] == "kept");
}

TEST_F(ScriptServerTest, FindsTheHostThatIsWanted) {
    ServerProcess process;
    ASSERT_TRUE(process.AwaitLine("Started"));
    ScriptVal server = process.Connect();
    auto add = [&](const char* id, const ScriptVal& priorities) {
        server.CallMember("AddHost",
                          Table({{"Name", "Host"}, {"UUID", id}, {"Priorities", priorities}}));
    };
    add("1", ScriptVal());
    add("2", Table({{"low", -INFINITY}, {"mid", 5}, {"text", "9"}, {"nan", NAN}}));
    add("3", Table({{"mid", 7}, {"nan", 0}}));
    add("4", Table({{"mid", 7}}));
    struct Case {
        ScriptVal name, uuid, key;
        const char* found;
    };
    const Case cases[] = {
        {"Host", {}, {}, "1"},       // the oldest
        {"host", {}, {}, nullptr},   // by the exact name
        {"Host", "4", {}, "4"},      // of this UUID
        {"Host", "5", {}, nullptr},  //
        {"Host", "", "", "1"},       // empty is as good as not given
        {"Host", 4, 5, "1"},         // and so is what is no text
        {"Host", {}, "mid", "3"},    // the highest, and of two the earlier
        {"Host", "2", "mid", "2"},   //
        {"Host", {}, "low", "2"},    // whatever number it is
        {"Host", {}, "nan", "3"},    // but not a number it must be
        {"Host", {}, "text", nullptr}, {"Host", {}, "none", nullptr}, {5, {}, {}, nullptr},
    };
    for (const Case& c : cases) {
        ScriptVal found = server.CallMember("FindHost", c.name, c.uuid, c.key);
        const char* uuid = found.FindKeyConst("UUID").ToString();
        EXPECT_STREQ(uuid, c.found) << c.key.ToString("");
    }
}

TEST_F(ScriptServerTest, ForgetsWhoHasGone) {
    ServerProcess process;
    ASSERT_TRUE(process.AwaitLine("Started"));
    ScriptVal client = process.Connect();
    ScriptVal host = process.Connect();
    host.CallMember("AddHost", Table({{"Name", "Twice"}}));
    host.CallMember("AddHost", Table({{"Name", "Twice"}}));
    EXPECT_EQ(Names(client.CallMember("GetHostList")), "Twice Twice ");
    host.GetApp()->_Disconnect(kLimitMs);
    EXPECT_TRUE(process.AwaitLine("Host 'Twice' Killed\n"));
    EXPECT_TRUE(process.AwaitLine("Host 'Twice' Killed\n"));
    EXPECT_EQ(Names(client.CallMember("GetHostList")), "");
}

TEST_F(ScriptServerTest, HasRoomForManyButNotForAll) {
    ServerProcess process;
    ASSERT_TRUE(process.AwaitLine("Started"));
    std::vector<ScriptVal> servers;
    for (int i = 0; i < 200; i++) {
        servers.push_back(process.Connect());
        servers.back().CallMember("AddHost", Table({{"Name", std::to_string(i).c_str()}}));
    }
    ScriptVal& last = servers.back();
    EXPECT_EQ(last.CallMember("GetHostList").NumKeys(), 200u);
    EXPECT_TRUE(last.CallMember("FindHost", "123").IsTable());
    int count = 1;
    while (last.CallMember("AddHost", Table({{"Name", "more"}})) == true) count++;
    EXPECT_EQ(count, static_cast<int>(HostRegistry::kMostHostsOfOne));
    EXPECT_TRUE(servers[0].CallMember("AddHost", Table({{"Name", "more"}})) == true);
    std::string large(60000, 'x');
    ScriptVal info = Table({{"Name", "large"}, {"Text", large.c_str()}});
    for (count = 0; servers[1].CallMember("AddHost", info) == true;) count++;
    EXPECT_EQ(count, 17) << "a MiB";
}

TEST_F(ScriptServerTest, TellsHosts) {
    ServerProcess process;
    ASSERT_TRUE(process.AwaitLine("Started"));
    ScriptVal one = process.Connect(), other = process.Connect();
    one.CallMember("AddHost", Table({{"Name", "One"}}));
    other.CallMember("AddHost", Table({{"Name", "Other"}}));
    one.CallMember("NotifyHosts", "Tell", 1);
    EXPECT_TRUE(WaitUntil([] { return PlayedHost::s_Told == 2; }));
    one.CallMember("NotifyHosts", "Tell", 10, false);
    one.CallMember("NotifyHosts", 5, 1000);
    one.CallMember("NotifyHosts", "Tell", 100);  // in the order in which they were asked for
    EXPECT_TRUE(WaitUntil([] { return PlayedHost::s_Told == 212; })) << PlayedHost::s_Told;
}

TEST_F(ScriptServerTest, StartsHosts) {
    ServerProcess process;
    ASSERT_TRUE(process.AwaitLine("Started"));
    ScriptVal server = process.Connect();
    TempDir dir;
    std::string touch = "/bin/touch " + dir.Path("began");
    // The first result, and the second one, of a call.
    auto start = [&](const ScriptVal& name, const ScriptVal& command, bool force = false) {
        ScriptArgs args;
        ScriptVal result;
        args.SetArguments(name, command, force);
        args.SetPosition(0, "StartHost");
        server.ToRemoteObject()->DoCommand(SST_CallMemberFunction, args, result);
        EXPECT_EQ(result[-1] == true, result[-2].IsNumber());
        return result[-2].ToNumber(-1);
    };
    server.CallMember("AddHost", Table({{"Name", "There"}, {"ProcessID", 5}}));
    EXPECT_EQ(start("There", touch.c_str()), 5);
    EXPECT_EQ(start("There", 5), -1);
    EXPECT_EQ(start(5, touch.c_str()), -1);
    EXPECT_EQ(start("Not", "/no/such/program"), -1);
    EXPECT_NE(access(dir.Path("began").c_str(), F_OK), 0);
    double processID = start("There", touch.c_str(), true);
    EXPECT_GT(processID, 5);
    EXPECT_TRUE(WaitUntil([&] { return access(dir.Path("began").c_str(), F_OK) == 0; }));
    EXPECT_TRUE(WaitUntil([&] { return kill(static_cast<pid_t>(processID), 0) != 0; }))
        << "nothing of it stays behind";
}

TEST_F(ScriptServerTest, AnswersOrNot) {
    ServerProcess process;
    ASSERT_TRUE(process.AwaitLine("Started"));
    ScriptVal server = process.Connect();
    ScriptArgs args;
    args.SetArguments(true);
    ScriptVal result;
    args.SetPosition(0, "PktTest");
    EXPECT_TRUE(server.ToRemoteObject()->DoCommand(SST_CallMemberFunction, args, result));
    server.GetApp()->SetTimeOut(0.05);
    args.SetPosition(1, false);
    EXPECT_FALSE(server.ToRemoteObject()->DoCommand(SST_CallMemberFunction, args, result));
    server = SV_Nil;
    EXPECT_TRUE(process.AwaitLine("Terminated")) << "a reply that never comes keeps nothing open";
}

TEST_F(ScriptServerTest, LeavesWhenNobodyIsThere) {
    ServerProcess idle(FreePort(), "2");
    EXPECT_TRUE(idle.AwaitLine("Started") && idle.AwaitLine("Terminated"));
    EXPECT_EQ(idle.AwaitEnd(), 0);

    ServerProcess process(FreePort(), "4294967294");
    ASSERT_TRUE(process.AwaitLine("Started"));
    ServerProcess second(process.GetPort());
    EXPECT_TRUE(second.AwaitLine("failed to bind socket: Error "));
    EXPECT_EQ(second.AwaitEnd(), 0);
    ScriptVal server = process.Connect();
    server.CallMember("AddHost", Table({{"Name", "Host"}}));
    server.GetApp()->_Disconnect(kLimitMs);
    EXPECT_TRUE(process.AwaitLine("Host 'Host' Killed\n"));
    EXPECT_TRUE(process.AwaitLine("Terminated\n"));
    EXPECT_EQ(process.AwaitEnd(), 0);

    ServerProcess eternal(FreePort(), "4294967295");
    ASSERT_TRUE(eternal.AwaitLine("Started"));
    for (int i = 0; i < 2; i++) {
        server = eternal.Connect();
        server.CallMember("AddHost", Table({{"Name", "Host"}}));
        server.GetApp()->_Disconnect(kLimitMs);
        EXPECT_TRUE(eternal.AwaitLine("Host 'Host' Killed\n"));
    }
}

TEST_F(ScriptServerTest, DoesWithoutDiscovery) {
    unsigned int port = FreePort();
    _Socket* taken = Platform::NewSocket(Platform::ST_UDP);
    ASSERT_TRUE(Platform::BindSocket(taken, port, kLoopback));
    ServerProcess process(port);
    EXPECT_TRUE(process.AwaitLine("Started"));
    EXPECT_TRUE(process.AwaitLine("failed to bind pingsocket: Error "));
    EXPECT_TRUE(process.Connect().CallMember("GetHostList").IsTable());
    Platform::DeleteSocket(taken);
    EXPECT_TRUE(process.AwaitLine("Terminated\n"));
}

// In a program of its own. Until the main loop lets it, the server does not end.
TEST(ScriptServerMain, DoesOnItsMainLoopWhatItIsGiven) {
    g_ScriptConfig = nullptr;
    const unsigned int usualPort = std::exchange(g_ScriptServerPort, FreePort());
    const unsigned int usualDelay = std::exchange(g_ScriptServerExitDelay, UINT32_MAX);
    std::thread::id loop;
    std::thread main([&] {
        loop = std::this_thread::get_id();
        ScriptServerMain();
    });
    auto execute = [](ScriptConfig::UIFunction function, void* data, bool wait) {
        ScriptConfig* config = g_ScriptConfig;
        return config ? config->UIExecute(function, data, nullptr, wait) : 0;
    };
    auto isLoop = [](void* thread, void*) -> unsigned long long {
        return *static_cast<std::thread::id*>(thread) == std::this_thread::get_id() ? 2 : 1;
    };
    unsigned long long result = 0;
    EXPECT_TRUE(WaitUntil([&] { return (result = execute(isLoop, &loop, true)) != 0; }));
    EXPECT_EQ(result, 2u);
    auto nested = [](void* function, void* thread) -> unsigned long long {
        auto* inner = *static_cast<ScriptConfig::UIFunction*>(function);
        return g_ScriptConfig.load()->UIExecute(inner, thread, nullptr, true);
    };
    ScriptConfig::UIFunction inner = isLoop;
    EXPECT_EQ(g_ScriptConfig.load()->UIExecute(nested, &inner, &loop, true), 2u);
    auto end = [](void*, void*) -> unsigned long long { return g_ScriptServerExitDelay = 0; };
    EXPECT_EQ(execute(end, nullptr, false), 0u);
    main.join();
    EXPECT_EQ(execute(isLoop, &loop, true), 0u) << "nobody is there to do it";
    g_ScriptConfig = nullptr;
    SetGUIThread(Platform::GetCurrentThreadID());
    g_ScriptServerPort = usualPort;
    g_ScriptServerExitDelay = usualDelay;
}

TEST_F(ScriptServerTest, AnswersDatagrams) {
    ServerProcess process;
    ASSERT_TRUE(process.AwaitLine("Started"));
    PlayedHost::s_PingInfo = Table({{"Status", "busy"}, {"Version", "mine"}});
    ScriptVal host = process.Connect();
    host.CallMember("AddHost", Table({{"Name", "Host"}, {"PingInfo", Table({{"Status", "new"}})}}));
    EXPECT_TRUE(WaitUntil([&] {
        return process.Ask("SPP:Host").find("Status = \"busy\"") != std::string::npos;
    })) << "the server asks its hosts how they do";
    std::string answer = process.Ask("SPP:Host");
    EXPECT_EQ(answer.rfind("RSP:{", 0), 0u);
    EXPECT_EQ(answer.find('\0'), answer.size() - 1);
    for (const char* part : {"Type = \"Host\"", "Version = \"18.0\"", "UserName = \"tester\"",
                             "Platform = \"Linux\"", "HostName = \""}) {
        EXPECT_NE(answer.find(part), std::string::npos) << part;
    }
    EXPECT_EQ(answer.find("mine"), std::string::npos);
    EXPECT_NE(process.Ask("SPP:").find("\"Host\""), std::string::npos);
    for (const char* name : {"SPP:host", "SPP", "", "RSP:Host", "spp:Host", "SPP:Host "}) {
        EXPECT_EQ(process.Ask(name), "") << name;
    }
    EXPECT_EQ(process.Ask("SPP:" + std::string(1020, 'x')), "");
    EXPECT_EQ(process.Ask(std::string(60000, 'x')), "");
}

// Datagrams

class AnswerTest : public ScriptServerTest {
protected:
    void Add(const ScriptVal& info) {
        ScriptHost host;
        EXPECT_TRUE(HostRegistry::MakeHost(info, m_App.Get(), host) && m_Hosts.Add(host));
    }
    std::string Answer(const std::string& name) const {
        return AnswerDatagram(m_Hosts, "SPP:" + name, m_Machine);
    }

    ptr<RemoteApp> m_App{new RemoteApp("host", 0, nullptr)};
    HostRegistry m_Hosts;
    const ScriptVal m_Machine = Table({{"Version", "18.0"}, {"Platform", "Linux"}});
};

TEST_F(AnswerTest, FitsByLeavingOutWholeEntries) {
    size_t longest = 0;
    for (int i = 0;; i++) {
        ASSERT_LT(i, 200);
        bool isCut = Answer("").find("Truncated = true") != std::string::npos;
        if (isCut) break;
        Add(Table({{"Name", ("name" + std::to_string(1000 + i)).c_str()}}));
        longest = std::max(longest, Answer("").size());
    }
    EXPECT_LE(longest, kMaxDatagram);
    EXPECT_GT(longest, kMaxDatagram - 20) << "and uses the room";
    EXPECT_NE(Answer("").find("name1000"), std::string::npos) << "the last ones are left out";
    EXPECT_TRUE(m_Hosts.Find("name1000", {}, {}).IsNil()) << "who is not connected is only told of";

    ScriptVal pingInfo(SV_Table, nullptr);
    pingInfo["First"] = 1;
    pingInfo["Large"] = std::string(2000, 'x').c_str();
    pingInfo["Last"] = 2;
    Add(Table({{"Name", "Large"}, {"PingInfo", pingInfo}}));
    std::string answer = Answer("Large");
    for (const char* part : {"First = 1", "Last = 2", "Truncated = true", "Type = \"Large\""}) {
        EXPECT_NE(answer.find(part), std::string::npos) << part;
    }
    EXPECT_EQ(answer.find("xxx"), std::string::npos);
    Add(Table({{"Name", std::string(1010, 'x').c_str()}}));
    EXPECT_LE(Answer(std::string(1010, 'x')).size(), kMaxDatagram);
    for (size_t length = 800; length < 1100; length++) {
        ScriptVal machine = m_Machine;
        machine["UserName"] = std::string(length, 'u').c_str();
        answer = AnswerDatagram(m_Hosts, "SPP:", machine);
        EXPECT_NE(answer.find("Hosts = {"), std::string::npos) << length;
        EXPECT_LE(answer.size(), kMaxDatagram);
    }
}

TEST_F(AnswerTest, LeavesOutWhatIsNotForAnybody) {
    ScriptVal made = Table({{"x", 1}});
    made.SetConstructor("Made");
    ScriptVal object(m_Host.Get());
    ScriptVal pingInfo =
        Table({{"object", object},
               {"made", made},
               {"code", ScriptVal("abc", 3, 0)},
               {"nan", NAN},
               {"__ctor", "Made"},
               {"deep", Table({{"two", Table({{"three", Table({{"four", 1}})}})}})},
               {"deeper", Table({{"2", Table({{"3", Table({{"four", Table({{"gone", 1}})}})}})}})},
               {"good", true}});
    Add(Table({{"Name", "Host"}, {"PingInfo", pingInfo}}));
    std::string answer = Answer("Host");
    for (const char* part : {"object", "made", "Made", "code", "nan", "gone"}) {
        EXPECT_EQ(answer.find(part), std::string::npos) << part << answer;
    }
    for (const char* part : {"good = true", "four = 1"}) {
        EXPECT_NE(answer.find(part), std::string::npos) << part << answer;
    }
}

TEST_F(AnswerTest, HostsAreAskedEveryTenSeconds) {
    auto count = [&](int64_t ms) { return m_Hosts.TakeDuePings(ms).size(); };
    Add(Table({{"Name", "First"}}));
    EXPECT_EQ(count(5000), 1u);
    EXPECT_EQ(count(15000), 0u);
    Add(Table({{"Name", "Second"}}));
    EXPECT_EQ(count(15001), 2u);
    EXPECT_EQ(count(25001), 0u);
}

// Against false senders. Time is the test's own.
TEST(AnswerLimiter, GivesAnAddressAFewAnswersASecond) {
    AnswerLimiter limiter;
    auto count = [&](unsigned int ip, int64_t ms) {
        int number = 0;
        while (number < 1000 && limiter.Allow(ip, ms)) number++;
        return number;
    };
    constexpr unsigned int kFirst = 0x01000003, kOther = 0x02000003;
    EXPECT_EQ(count(kFirst, 5000), 10);
    EXPECT_EQ(count(kFirst, 5999), 0);
    EXPECT_EQ(count(kOther, 5999), 10);
    EXPECT_EQ(count(kFirst, 6000), 10);
    EXPECT_EQ(count(kLoopback, 6000), 1000);
    for (unsigned int ip = 1; ip <= AnswerLimiter::kMostAddresses; ip++) {
        limiter.Allow(ip << 8 | 4, 6500);
    }
    EXPECT_EQ(count(0x05000005, 6500), 0) << "the memory for addresses has a limit";
    EXPECT_EQ(count(0x05000005, 7500), 10);
}

}  // namespace
}  // namespace Korvel

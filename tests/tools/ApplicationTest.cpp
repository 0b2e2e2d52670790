// The command line tool at work on the example host: three kinds of real processes.
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>
#include <thread>

#include "Support.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;

class Application : public testing::Test {
protected:
    ProcessResult Run(const std::string& text) {
        return RunProcess({OXSCRIPT, "-a", std::to_string(m_Host.GetPort()), "-e", text});
    }
    void Expect(const std::string& text, const std::string& out) {
        ProcessResult result = Run(text);
        EXPECT_EQ(result.m_Err, "") << text;
        EXPECT_EQ(result.m_Out, out) << text;
    }

    HostProcess m_Host{MEDIAHOST};
};

bool Contains(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

// A socket that has a port of this machine.
struct LoopbackPort {
    LoopbackPort() {
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t size = sizeof(address);
        EXPECT_EQ(bind(m_Socket, reinterpret_cast<sockaddr*>(&address), size), 0);
        getsockname(m_Socket, reinterpret_cast<sockaddr*>(&address), &size);
        m_Port = ntohs(address.sin_port);
    }
    ~LoopbackPort() { close(m_Socket); }

    const int m_Socket = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    int m_Port;
};

TEST_F(Application, RunsTheDemo) {
    ProcessResult result = RunProcess({OXSCRIPT, "-a", std::to_string(m_Host.GetPort()), DEMO});
    EXPECT_EQ(result.m_Status, 0);
    EXPECT_EQ(result.m_Err, "");
    EXPECT_TRUE(Contains(result.m_Out, "3 clips and takes 12.5 s")) << result.m_Out;
    EXPECT_TRUE(Contains(result.m_Out, "287 pictures of brightness")) << result.m_Out;
    EXPECT_TRUE(Contains(result.m_Out, "number Timeline:Add(Clip clip)")) << result.m_Out;
}

TEST_F(Application, IsWhatScriptsWorkOn) {
    Expect("local c = app:Clip('One', 2) app.Timeline:Add(c) print(app.Timeline.One.Length)",
           "2\n");
    Expect("print(app.Timeline[1].Name, app.Timeline:Remove('One').Name, app.Timeline[1])",
           "One\tOne\tnil\n");  // what one script has left, the next one finds
    Expect("print(app.CountUses, app.Reset ~= nil)", "nil\ttrue\n");  // for debug mode, hidden
    Expect("app.Title = 'x' app:Reset() print(app.Title)", "Untitled\n");
    Expect(
        "local t, a, b = app.Timeline, app:Clip('A', 1), app:Clip('A', 2) t:Add(a) t:Add(b) "
        "print(t:Add(b), #app.LastError > 0, #t:GetClips()) a.Length = 5 print(b.Start) "
        "print(t[1.5], t[0], t[3], t:Remove(2) == b, b.Start, t.Duration) app:Reset()",
        "nil\ttrue\t2\n5\nnil\tnil\tnil\ttrue\tnil\t5\n");
    HostProcess debugged(MEDIAHOST, "--debug");
    ProcessResult result = RunProcess({OXSCRIPT, "-a", std::to_string(debugged.GetPort()), "-e",
                                       "print(app:CountUses().UseCount)"});
    EXPECT_EQ(result.m_Out, "1\n") << result.m_Err;
}

TEST_F(Application, AnswersOthersDuringARender) {
    std::thread render([this] {
        ProcessResult result =
            Run("app.Timeline:Add(app:Clip('Long', 86400)) print(app.Timeline:Render())");
        EXPECT_EQ(result.m_Out, "\n");
        EXPECT_EQ(result.m_Err, "oxscript: MediaHost: The render has been stopped.\n");
    });
    Expect(
        "repeat until app.Progress > 0 print(app.Timeline:Render()) app.LastError = 1 "
        "print(app.LastError) app:Reset()",
        "\nA render is under way.\n");
    render.join();
}

TEST_F(Application, RendersForNobodyWhoHasGone) {
    RunProcess({"/usr/bin/timeout", "-s", "KILL", "1", OXSCRIPT, "-a",
                std::to_string(m_Host.GetPort()), "-e",
                "app.Timeline:Add(app:Clip('Long', 86400)) app.Timeline:Render()"});
    Expect(
        "app.Timeline:Remove('Long') app.Timeline:Add(app:Clip('Short', 1)) "
        "local stop, frames = orv.gettime() + 60 "
        "repeat frames = app.Timeline:Render() until frames or orv.gettime() > stop "
        "local _ = app.LastError print(frames)",
        "25\n");
}

TEST_F(Application, ShowsErrorsThatNobodyHasRead) {
    ProcessResult result = Run("app:Clip('x', 0)");
    EXPECT_EQ(result.m_Err,
              "oxscript: MediaHost: A clip takes more than 0 seconds, and at most a day.\n");
    EXPECT_EQ(result.m_Status, 0);
    Expect("app:Clip('x', 0) print(#app.LastError > 0)", "true\n");
    result = Run("app:Clip('x', 0) error('stop', 0)");
    EXPECT_EQ(result.m_Status, 255);
    EXPECT_TRUE(result.m_Err.starts_with("oxscript: stop\n")) << result.m_Err;
    EXPECT_TRUE(Contains(result.m_Err, "oxscript: MediaHost: A clip")) << result.m_Err;
}

TEST_F(Application, MayNotBeThere) {
    struct Case {
        std::string port;
        const char* message;
    };
    LoopbackPort silent, refuser;  // nobody listens at the first one
    std::string taken = std::to_string(silent.m_Port), refusing = std::to_string(refuser.m_Port);
    listen(refuser.m_Socket, 5);
    std::thread refuse([&] {
        for (int caller; (caller = accept(refuser.m_Socket, nullptr, nullptr)) >= 0;) close(caller);
    });
    for (const Case& c : {Case{taken, "nobody listens there"}, Case{refusing, "refuses"},
                          Case{"70000", "'70000' is no port"}, Case{"12x", "'12x' is no port"},
                          Case{"", "'' is no port"}}) {
        ProcessResult result = RunProcess({OXSCRIPT, "-a", c.port, "-e", "print(1)"});
        bool isPort = c.port == taken || c.port == refusing;
        EXPECT_EQ(result.m_Status, isPort ? 255 : 2);
        EXPECT_EQ(result.m_Out, "");
        EXPECT_TRUE(Contains(result.m_Err, c.message)) << result.m_Err;
    }
    shutdown(refuser.m_Socket, SHUT_RDWR);
    refuse.join();
}

// Scripts that share one timeline, and others that are killed in the middle. KORVEL_SOAK_SECONDS is
// how long they work.
TEST_F(Application, SoakServesManyScriptsAtOnce) {
    const char* told = getenv("KORVEL_SOAK_SECONDS");
    std::string seconds = told ? told : "2";
    const std::string script = "local stop = orv.gettime() + " + seconds + R"lua(
        app:SetTimeout(60)
        local name, timeline, n = "Clip" .. orv.getpid(), app.Timeline, 0
        while orv.gettime() < stop do
            n = n + 1
            local clip = app:Clip("new", 1 + n % 3)
            clip.Name = name .. n % 7
            timeline:Add(clip)
            assert(clip:GetFrame(n).Size == 2304)
            for _, other in ipairs(timeline:GetClips()) do assert(other.Name:find "^Clip") end
            local first = timeline[1]
            if first then first:GetAttrs() end
            timeline:Remove(clip.Name)
            if n % 50 == 0 then timeline:Render() end
            if n % 97 == 0 then app:Reset() end
            local _ = app.LastError
        end
        assert(n > 0))lua";
    std::vector<std::thread> threads;
    for (int i = 0; i < 10; i++) {
        threads.emplace_back([&, i] {
            if (i < 8) return Expect(script, "");
            const std::string port = std::to_string(m_Host.GetPort());
            for (int end = 0; end < 5; end++) {
                RunProcess(
                    {"/usr/bin/timeout", "-s", "KILL", "0.3", OXSCRIPT, "-a", port, "-e", script});
            }
        });
    }
    for (std::thread& thread : threads) thread.join();
    Expect("print(app:IsAppConnected())", "true\n");
    EXPECT_EQ(m_Host.End(SIGTERM), 0);
}

// A host and three scripts, each in a process of its own: objects go from the host to one script,
// home again and on to another one, and in the end nothing of all that is left.
TEST(Objects, GoThroughThreeProcessesAndComeBack) {
    HostProcess host(COUNTING_HOST);
    auto run = [&](const char* text) {
        return RunProcess({OXSCRIPT, "-a", std::to_string(host.GetPort()), "-e", text});
    };
    // Another one ends in the middle of a call.
    ProcessResult killed = run(R"lua(
        items = {}
        for i = 1, 100 do items[i] = app:Item(i) end
        app:Kill(orv.getpid()))lua");
    EXPECT_EQ(killed.m_Status, -1 - SIGKILL) << killed.m_Err;

    ProcessResult first, second;
    std::thread thread([&] {
        first = run(R"lua(
            repeat until app.NumItems == 0
            local items = {}
            for i = 1, 100 do items[i] = app:Item(i) end
            assert(app:IsHome(items[100]))
            app:MeetCaller()
            app.Kept = items
            repeat until app.IsDone
            assert(app.NumItems == 100 and items[7].Number == 70)
            items = nil
            collectgarbage()
            repeat until app.NumItems == 0
            print "all gone")lua");
    });
    second = run(R"lua(
        repeat items = app.Kept until items
        assert(#items == 100)
        for i, item in ipairs(items) do
            assert(item.Number == i and app:IsHome(item))
            item.Number = i * 10
        end
        assert(app.HasCaller and app.Caller == nil)  -- it is a proxy of another connection
        app.Kept = nil
        app.IsDone = true
        print "seen")lua");
    thread.join();
    EXPECT_EQ(first.m_Out + first.m_Err, "all gone\n");
    EXPECT_EQ(second.m_Out + second.m_Err, "seen\n");
    EXPECT_EQ(host.End(SIGTERM), 0);
}

TEST_F(Application, MayEndWhileScriptsWait) {
    std::thread wait([this] {
        ProcessResult result =
            Run("app.Timeline:Add(app:Clip('Long', 86400)) app.Timeline:Render() "
                "print(app:IsAppConnected(), app.Title)");
        EXPECT_EQ(result.m_Status, 0);
        EXPECT_EQ(result.m_Out, "false\tnil\n") << result.m_Err;
        EXPECT_TRUE(Contains(result.m_Err, "oxscript: MediaHost has gone.\n")) << result.m_Err;
    });
    Run("repeat until app.Progress > 0 app:Quit()");
    wait.join();
    EXPECT_EQ(m_Host.End(0), 0);
}

}  // namespace
}  // namespace Korvel

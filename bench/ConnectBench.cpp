// How long it takes to find a host: from ScriptApp("Name") to the first reply of the application,
// beside the same by address, and a bare TCP connection to the host without any reply. And what a
// host pays for being found: StartScripting with a script server that runs, and without one.
// Server, hosts and caller are processes.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "Compare.h"
#include "core/RefObject.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptServer.h"

extern char** environ;

namespace Korvel::Bench {
namespace {

using Clock = std::chrono::steady_clock;

constexpr char kThisMachine[] = "127.0.0.1";
constexpr char kHostOption[] = "--host";
constexpr double kLimitSeconds = 60;
const char* s_Program;

class Answering : public Scripted<_Object> {
    KORVEL_SCRIPTED(Answering)
public:
    Answering() { SetScriptClass(); }
};
KORVEL_PUBLISH(Answering, "Answering", "", "")
KORVEL_FUNCTION(Answering, Answer, SSF_AnyThread) {
    args.ReturnNumber(42);
}
KORVEL_PUBLISHED(Answering);

void InstallConfig(uint32_t flags, const char* name) {
    static Answering s_App;
    static ScriptConfig s_Config;
    s_Config.m_Flags = flags;
    s_Config.m_AppName = name;
    s_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return &s_App; };
    _InitScripting(s_Config);
}

void UsePort(unsigned int port) {
    g_ScriptServerPort = port;
    setenv("KORVEL_ScriptServerPort", std::to_string(port).c_str(), 1);
}

// A port that nobody has had, so that no server that is about to leave is met.
unsigned int NewPort() {
    static unsigned int s_Next = 20000 + static_cast<unsigned int>(getpid()) % 9000;
    return s_Next++;
}

// A child whose end of a pipe is its standard output.
class Process {
public:
    explicit Process(const char* program, const char* option = nullptr) {
        int ends[2];
        if (pipe(ends)) abort();
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, ends[1], STDOUT_FILENO);
        posix_spawn_file_actions_addclose(&actions, ends[0]);
        posix_spawn_file_actions_addclose(&actions, ends[1]);
        char* const argv[] = {const_cast<char*>(program), const_cast<char*>(option), nullptr};
        if (posix_spawn(&m_Process, program, &actions, nullptr, argv, environ)) m_Process = 0;
        posix_spawn_file_actions_destroy(&actions);
        close(ends[1]);
        m_Out = fdopen(ends[0], "r");
    }
    Process(const Process&) = delete;
    Process& operator=(const Process&) = delete;
    ~Process() {
        fclose(m_Out);
        if (!m_Process) return;
        kill(m_Process, SIGKILL);
        waitpid(m_Process, nullptr, 0);
    }

    // Its next line; empty at its end.
    std::string Read() {
        char line[256] = "";
        return fgets(line, sizeof(line), m_Out) ? line : "";
    }

private:
    pid_t m_Process = 0;
    FILE* m_Out;
};

// The child: starts scripting, tells its port and how long that took, and stays.
int RunHost() {
    InstallConfig(SCF_Host | SCF_Standard, "Bench");
    auto start = Clock::now();
    bool isStarted = StartScripting(ScriptVal());
    std::chrono::duration<double> taken = Clock::now() - start;
    bool isKnown = GetHost().ToBoolean();
    printf("%u %.9f\n", isStarted && isKnown ? GetListenPort() : 0, taken.count());
    fflush(stdout);
    pause();
    return 0;
}

// The server and the host that all connect to.
class Machine {
public:
    Machine() {
        UsePort(NewPort());
        setenv("KORVEL_ScriptServerExitDelay", "4294967295", 1);
        m_Server = std::make_unique<Process>(OXSCRIPT, "-s");
        m_Server->Read();
        m_Host = std::make_unique<Process>(s_Program, kHostOption);
        sscanf(m_Host->Read().c_str(), "%u", &m_HostPort);
    }
    unsigned int GetHostPort() const { return m_HostPort; }

private:
    std::unique_ptr<Process> m_Server, m_Host;
    unsigned int m_HostPort = 0;
};

Machine& GetMachine() {
    static Machine s_Machine;
    return s_Machine;
}

// To the first reply. The end of the connection is no part of it.
template <class Connect>
void TimeConnect(benchmark::State& state, Connect connect) {
    for (auto _ : state) {
        auto start = Clock::now();
        ScriptVal root = connect();
        bool isAnswer = root.CallMember("Answer") == 42;
        std::chrono::duration<double> taken = Clock::now() - start;
        if (!isAnswer) return state.SkipWithError("no answer");
        state.SetIterationTime(taken.count());
    }
}

void ByName(benchmark::State& state) {
    GetMachine();
    TimeConnect(state, [] {
        return ScriptApp("!Bench", nullptr, ScriptVal(), kThisMachine, kLimitSeconds);
    });
}

void ByAddress(benchmark::State& state) {
    unsigned int port = GetMachine().GetHostPort();
    TimeConnect(state, [port] {
        ScriptVal reply;
        return ScriptApp(inet_addr(kThisMachine), port, reply, kLimitSeconds);
    });
}

void Bare(benchmark::State& state) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(GetMachine().GetHostPort()));
    address.sin_addr.s_addr = inet_addr(kThisMachine);
    for (auto _ : state) {
        auto start = Clock::now();
        int caller = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (connect(caller, reinterpret_cast<sockaddr*>(&address), sizeof(address))) {
            return state.SkipWithError("no connection");
        }
        std::chrono::duration<double> taken = Clock::now() - start;
        state.SetIterationTime(taken.count());
        // The host sees its end before the next one: else its queue runs over.
        shutdown(caller, SHUT_WR);
        for (char byte; recv(caller, &byte, 1, 0) > 0;) continue;
        close(caller);
    }
}

// A new host for each, which tells its own time.
bool TimeStart(benchmark::State& state) {
    Process host(s_Program, kHostOption);
    unsigned int port = 0;
    double seconds = 0;
    sscanf(host.Read().c_str(), "%u %lf", &port, &seconds);
    if (!port) state.SkipWithError("the host is not registered");
    state.SetIterationTime(seconds);
    return port != 0;
}

void StartWithServer(benchmark::State& state) {
    GetMachine();
    for (auto _ : state) {
        if (!TimeStart(state)) return;
    }
}

// Each time at a port where no server is. That which is started leaves with its host.
void StartWithout(benchmark::State& state) {
    unsigned int port = g_ScriptServerPort;
    setenv("KORVEL_ScriptServerExitDelay", "300", 1);
    for (auto _ : state) {
        UsePort(NewPort());
        if (!TimeStart(state)) break;
    }
    UsePort(port);
}

void Register() {
    using benchmark::RegisterBenchmark;
    auto timed = [](benchmark::internal::Benchmark* bench) {
        bench->UseManualTime()->Unit(benchmark::kMicrosecond);
    };
    timed(RegisterBenchmark("connect@by name", ByName));
    timed(RegisterBenchmark("connect@by address", ByAddress));
    timed(RegisterBenchmark("connect@bare", Bare));
    auto started = [](benchmark::internal::Benchmark* bench) {
        bench->UseManualTime()->Unit(benchmark::kMicrosecond)->Iterations(20);
    };
    started(RegisterBenchmark("start of a host@with a server", StartWithServer));
    started(RegisterBenchmark("start of a host@without", StartWithout));
}

}  // namespace
}  // namespace Korvel::Bench

int main(int argc, char** argv) {
    using namespace Korvel::Bench;
    setenv("KORVEL_ListenAddress", kThisMachine, 1);
    setenv("KORVEL_Tool", OXSCRIPT, 1);
    if (argc == 2 && strcmp(argv[1], kHostOption) == 0) return RunHost();
    s_Program = "/proc/self/exe";
    char path[4096] = "";
    if (readlink(s_Program, path, sizeof(path) - 1) > 0) s_Program = path;
    InstallConfig(Korvel::SCF_Standard, "Bench client");
    Register();
    return RunComparison(argc, argv);
}

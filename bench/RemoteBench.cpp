// Calls of another process over the loopback: one outstanding, many at once, and large blocks.
// Beside a bare exchange over a socket, the same with a hand-off between threads, and other systems
// where they are installed. Both processes on one processor, on one each, or wherever the scheduler
// puts them; the columns stand in the same run.
//
// Calls per second are in the counters, and so are the median and the 99th percentile of one call.
// In the table a single call has its median time, and one of several at once the time that its
// thread takes for it. A block's bytes count in each direction.
#include "RemoteBench.h"

#include <dirent.h>
#include <sched.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "Compare.h"
#include "Platform/Networking.h"
#include "core/RefObject.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"

namespace Korvel::Bench {
namespace {

// Our own calls

class Echo : public Scripted<_Object> {
    KORVEL_SCRIPTED(Echo)
public:
    Echo() { SetScriptClass(); }
};

KORVEL_PUBLISH(Echo, "Echo", "Gives back what it gets.", "")
// Moved, because only the way there and back is of interest.
KORVEL_OPCODE(Echo, SST_Call, SSF_AnyThread) {
    args.Return() = std::move(args[1]);
}
KORVEL_PUBLISHED(Echo);

Platform::_Socket* const kNoSocket = reinterpret_cast<Platform::_Socket*>(-1);
constexpr unsigned int kLoopback = 0x0100007F;  // 127.0.0.1 in network order

// A call that has not come back by then is a fault.
constexpr double kLimitSeconds = 60;

// Both ends have an application's object, and it lives as long as the process.
void InstallConfig() {
    static Echo s_Echo;
    static ScriptConfig s_Config;
    s_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return &s_Echo; };
    g_ScriptConfig = &s_Config;
}

uint16_t Serve() {
    using namespace Platform;
    InstallConfig();
    _Socket* listener = NewSocket(ST_TCP);
    if (!BindSocket(listener, 0, kLoopback) || !ListenSocket(listener, 128)) return 0;
    _SocketAddress* address = GetSocketAddress(listener);
    unsigned int port = SocketAddressGetPort(address);
    DeleteSocketAddress(address);
    std::thread([listener] {
        for (_Socket* socket; (socket = AcceptSocket(listener)) != kNoSocket;) {
            auto* app = new RemoteApp("client", 0, nullptr);
            app->Connect(socket);
            app->Recycle();  // its thread holds it as long as it runs
        }
    }).detach();
    return static_cast<uint16_t>(port);
}

class KorvelLink : public Link {
public:
    KorvelLink(RemoteApp* app, RemoteApp* peer) : m_App(app), m_Peer(peer) {
        m_App->SetTimeOut(kLimitSeconds);
        m_Proxy = m_App->FindRemoteObject(1);
    }
    ~KorvelLink() override {
        m_Proxy = SV_Nil;
        for (RemoteApp* app : {m_App, m_Peer}) {
            if (!app) continue;
            app->_Disconnect(0xffffffff);
            app->Recycle();
        }
    }
    bool Call(double number) override {
        ScriptArgs args;
        args.SetArguments(number);
        ScriptVal result;
        return Do(args, result) && result.FindKeyConst(-1).ToNumber() == number;
    }
    bool Block(std::span<const char> block) override {
        if (!m_BlockArgs[1].IsMemBlock()) {
            m_BlockArgs.SetArguments(
                MemBlock(const_cast<char*>(block.data()), static_cast<uint32_t>(block.size())));
        }
        ScriptVal result;
        return Do(m_BlockArgs, result) &&
               result.FindKeyConst(-1).ToMemBlock().m_Size == block.size();
    }

private:
    bool Do(ScriptArgs& args, ScriptVal& result) const {
        return m_Proxy.ToRemoteObject()->DoCommand(SST_Call, args, result);
    }

    RemoteApp* const m_App;
    RemoteApp* const m_Peer;  // null in another process
    ScriptVal m_Proxy;
    ScriptArgs m_BlockArgs;
};

std::unique_ptr<Link> Open(uint16_t port, bool) {
    InstallConfig();
    Platform::_Socket* socket = Platform::NewSocket(Platform::ST_TCP);
    if (!Platform::ConnectSocket(socket, port, kLoopback)) {
        Platform::DeleteSocket(socket);
        return nullptr;
    }
    auto* app = new RemoteApp("server", 0, nullptr);
    if (app->Connect(socket)) return std::make_unique<KorvelLink>(app, nullptr);
    app->Recycle();
    return nullptr;
}

std::unique_ptr<Link> OpenInProcess(uint16_t, bool) {
    InstallConfig();
    auto* app = new RemoteApp("near", 0, nullptr);
    auto* peer = new RemoteApp("far", 0, nullptr);
    if (RemoteApp::Join(app, peer)) return std::make_unique<KorvelLink>(app, peer);
    for (RemoteApp* each : {app, peer}) each->Recycle();
    return nullptr;
}

Sizes GetSizes(const ScriptVal& value) {
    ScriptArgs args;
    args.SetArguments(value);
    ScriptVal result(SV_Table, nullptr);
    result[-1] = value;
    Packet* request = CreatePkt(PKT_Script, nullptr, nullptr, &args);
    Packet* reply = CreateReply(1, nullptr, nullptr, &result);
    Sizes sizes{request->m_Size, reply->m_Size};
    FreePkt(request);
    FreePkt(reply);
    return sizes;
}

// Where the processes run

// A processor, or any that this bench may use.
constexpr int kAny = -1;

cpu_set_t GetProcessors() {
    cpu_set_t processors;
    CPU_ZERO(&processors);
    sched_getaffinity(0, sizeof(processors), &processors);
    return processors;
}
const cpu_set_t s_Processors = GetProcessors();

struct Placement {
    const char* m_Name;
    int m_Client;
    int m_Server;
};

std::vector<Placement> GetPlacements() {
    std::vector<int> processors;
    for (int i = 0; i < CPU_SETSIZE; i++) {
        if (CPU_ISSET(i, &s_Processors)) processors.push_back(i);
    }
    std::vector<Placement> placements{{"one processor", processors[0], processors[0]}};
    if (processors.size() > 1) {
        placements.push_back({"one each", processors[0], processors[1]});
        placements.push_back({"free", kAny, kAny});
    }
    return placements;
}

// A thread, 0 for this one. Those that it starts inherit it.
void Pin(pid_t thread, int processor) {
    cpu_set_t processors = s_Processors;
    if (processor != kAny) {
        CPU_ZERO(&processors);
        CPU_SET(static_cast<size_t>(processor), &processors);
    }
    sched_setaffinity(thread, sizeof(processors), &processors);
}

// All that there are: libraries keep some from row to row.
void PinProcess(int processor) {
    DIR* directory = opendir("/proc/self/task");
    if (!directory) return;
    while (dirent* entry = readdir(directory)) {
        if (pid_t thread = atoi(entry->d_name)) Pin(thread, processor);
    }
    closedir(directory);
}

// The other process: this program, with a socket for its input over which it tells its port. It
// ends with that socket, so it never outlives the bench.
class Server {
public:
    Server(const Variant& variant, int processor) {
        int ends[2];
        if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends)) return;
        m_Control = ends[0];
        std::string place = std::to_string(processor);
        const char* arguments[] = {"remote_bench", kSwitch, variant.m_Name, place.c_str(), nullptr};
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, ends[1], 0);
        if (posix_spawn(&m_Process, "/proc/self/exe", &actions, nullptr,
                        const_cast<char**>(arguments), environ)) {
            m_Process = 0;
        }
        posix_spawn_file_actions_destroy(&actions);
        close(ends[1]);
        if (recv(m_Control, &m_Port, sizeof(m_Port), MSG_WAITALL) != sizeof(m_Port)) m_Port = 0;
    }
    Server(const Server&) = delete;
    Server& operator=(const Server&) = delete;
    ~Server() {
        close(m_Control);
        if (m_Process) waitpid(m_Process, nullptr, 0);
    }
    uint16_t GetPort() const { return m_Port; }

    static constexpr const char* kSwitch = "--serve";

    // The body of the other process.
    static int Run(const Variant& variant, int processor) {
        Pin(0, processor);
        uint16_t port = variant.m_Serve();
        if (!port || send(0, &port, sizeof(port), MSG_NOSIGNAL) != sizeof(port)) return 1;
        char end;
        while (recv(0, &end, 1, 0) > 0) continue;
        _exit(0);  // its threads still serve
    }

private:
    int m_Control = -1;
    pid_t m_Process = 0;
    uint16_t m_Port = 0;
};

// What is measured

enum class Use {
    OneCall,  // with the time of each
    OneLink,  // calls of all threads through one connection
    OwnLink,  // each thread has its own
    Block,
};

struct Row {
    const char* m_Name;
    Use m_Use;
    int m_NumThreads;
};

constexpr Row kRows[] = {
    {"one call", Use::OneCall, 1},
    {"8 threads, 1 connection", Use::OneLink, 8},
    {"64 threads, 64 connections", Use::OwnLink, 64},
    {"1 MiB block", Use::Block, 1},
};

struct Case {
    Row m_Row;
    Variant m_Variant;
    Placement m_Placement;
};

std::atomic<bool> s_HasFailed{false};

// The other process, and a connection that all threads of a run share. The first thread of a run
// makes it, the last one ends it.
class Session {
public:
    explicit Session(const Case& which) {
        PinProcess(which.m_Placement.m_Client);
        if (which.m_Variant.m_Serve) {
            m_Server = std::make_unique<Server>(which.m_Variant, which.m_Placement.m_Server);
            m_Port = m_Server->GetPort();
        }
        if (which.m_Row.m_Use == Use::OneLink) m_Link = which.m_Variant.m_Open(m_Port, true);
    }

    // All threads have joined before the first one's measuring begins, and the next run's threads
    // start when these are through.
    static std::shared_ptr<Session> Join(const Case& which) {
        static std::mutex s_Lock;
        static std::weak_ptr<Session> s_Current;
        std::lock_guard guard(s_Lock);
        std::shared_ptr<Session> session = s_Current.lock();
        if (!session) s_Current = session = std::make_shared<Session>(which);
        return session;
    }

    // Null without a connection.
    Link* GetLink(const Case& which, std::unique_ptr<Link>& own) const {
        if (which.m_Row.m_Use == Use::OneLink) return m_Link.get();
        own = which.m_Variant.m_Open(m_Port, false);
        return own.get();
    }

private:
    std::unique_ptr<Server> m_Server;
    uint16_t m_Port = 0;
    std::unique_ptr<Link> m_Link;
};

void Fail(benchmark::State& state, const char* why) {
    s_HasFailed = true;
    state.SkipWithError(why);
}

// The median stands for the time of all calls.
void Report(benchmark::State& state, std::vector<double>& seconds) {
    if (seconds.empty()) return;
    auto at = [&](double share) {
        auto found = seconds.begin() +
                     static_cast<ptrdiff_t>(share * static_cast<double>(seconds.size() - 1));
        std::nth_element(seconds.begin(), found, seconds.end());
        return *found;
    };
    double median = at(0.5);
    state.counters["p50_us"] = median * 1e6;
    state.counters["p99_us"] = at(0.99) * 1e6;
    state.SetIterationTime(median * static_cast<double>(seconds.size()));
}

void TimeCalls(benchmark::State& state, Link& link) {
    using Clock = std::chrono::steady_clock;
    std::vector<double> seconds;
    seconds.reserve(static_cast<size_t>(state.max_iterations));
    double number = 0;
    link.Call(number);  // whatever is only done once
    Clock::time_point before = Clock::now();
    for (auto _ : state) {
        if (!link.Call(number++)) {
            Fail(state, "no answer");
            break;
        }
        Clock::time_point after = Clock::now();
        seconds.push_back(std::chrono::duration<double>(after - before).count());
        before = after;
    }
    Report(state, seconds);
}

void CountCalls(benchmark::State& state, Link& link) {
    double number = 0;
    for (auto _ : state) {
        if (!link.Call(number++)) {
            Fail(state, "no answer");
            break;
        }
    }
    state.SetItemsProcessed(state.iterations());
}

void PassBlocks(benchmark::State& state, Link& link) {
    std::vector<char> block(kBlockSize);
    for (size_t i = 0; i < block.size(); i++) block[i] = static_cast<char>(i * 7 >> 3);
    link.Block(block);  // memory and buffers are there from here on
    for (auto _ : state) {
        if (!link.Block(block)) {
            Fail(state, "no answer");
            break;
        }
    }
    state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(2 * kBlockSize));
}

void Run(benchmark::State& state, const Case& which) {
    Pin(0, which.m_Placement.m_Client);
    std::shared_ptr<Session> session = Session::Join(which);
    std::unique_ptr<Link> own;
    Link* link = session->GetLink(which, own);
    if (!link) {
        Fail(state, "no connection");
    } else if (which.m_Row.m_Use == Use::OneCall) {
        TimeCalls(state, *link);
    } else if (which.m_Row.m_Use == Use::Block) {
        PassBlocks(state, *link);
    } else {
        CountCalls(state, *link);
    }
}

const Variant* const kVariants[] = {
    &kKorvel,    &kHandOff, &kBareSocket, &kInOneProcess,
#ifdef KORVEL_BENCH_CAPNP
    &kCapnProto,
#endif
#ifdef KORVEL_BENCH_GRPC
    &kGrpc,
#endif
};

// Within one process there is nothing to put on a processor of its own.
bool IsOfUse(const Row& row, const Variant& variant, const Placement& placement) {
    return variant.m_Serve || (row.m_NumThreads == 1 && placement.m_Client == placement.m_Server);
}

void Register() {
    for (const Row& row : kRows) {
        for (const Placement& placement : GetPlacements()) {
            for (const Variant* variant : kVariants) {
                if (!IsOfUse(row, *variant, placement)) continue;
                std::string name(row.m_Name);
                name.append(", ").append(placement.m_Name).append("@").append(variant->m_Name);
                Case which{row, *variant, placement};
                auto* benchmark = benchmark::RegisterBenchmark(
                    name.c_str(), [which](benchmark::State& state) { Run(state, which); });
                if (row.m_Use == Use::OneCall) {
                    benchmark->UseManualTime();
                } else {
                    benchmark->UseRealTime();
                }
                if (row.m_NumThreads > 1) benchmark->Threads(row.m_NumThreads);
            }
        }
    }
}

}  // namespace

const Variant kKorvel{"korvel", Serve, Open};
const Variant kInOneProcess{"in one process", nullptr, OpenInProcess};

Sizes GetCallSizes() {
    return GetSizes(1.0);
}
Sizes GetBlockSizes() {
    std::vector<char> block(kBlockSize);
    return GetSizes(MemBlock(block.data(), kBlockSize));
}

}  // namespace Korvel::Bench

int main(int argc, char** argv) {
    using namespace Korvel::Bench;
    if (argc == 4 && strcmp(argv[1], Server::kSwitch) == 0) {
        for (const Variant* variant : kVariants) {
            if (strcmp(variant->m_Name, argv[2]) == 0) return Server::Run(*variant, atoi(argv[3]));
        }
        return 1;
    }
    Register();
    int result = RunComparison(argc, argv);
    return s_HasFailed ? 1 : result;
}

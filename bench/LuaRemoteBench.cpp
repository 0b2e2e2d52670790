// What scripts add to calls: `object:Foo(1)` in Lua, which is a look-up of the name and a call of
// what comes back, beside the same two exchanges in native code. The object is in another process,
// over the loopback, or in the same one; both processes run on one processor, so that the way
// between them is always the same.
#include <sched.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <thread>

#include "Compare.h"
#include "Platform/Networking.h"
#include "core/RefObject.h"
#include "core/TagList.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "runtime/Script.h"
#include "runtime/ScriptLanguage.h"

namespace Korvel::Bench {
namespace {

class Answer : public Scripted<_Object> {
    KORVEL_SCRIPTED(Answer)
public:
    Answer() { SetScriptClass(); }
};

KORVEL_PUBLISH(Answer, "Answer", "Gives back what it gets.", "")
KORVEL_FUNCTION(Answer, Foo, SSF_AnyThread) {
    args.Return(args[1]);
}
KORVEL_PUBLISHED(Answer);

constexpr unsigned int kLoopback = 0x0100007F;  // 127.0.0.1 in network order

// Both ends have an application's object, and it lives as long as the process.
void InstallConfig() {
    static Answer s_Answer;
    static ScriptConfig s_Config;
    s_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return &s_Answer; };
    g_ScriptConfig = &s_Config;
}

constexpr char kServe[] = "--serve";

// The other process: this program again, with a socket for its input over which it tells its port.
// It ends with that socket.
int Serve() {
    using namespace Platform;
    InstallConfig();
    _Socket* listener = NewSocket(ST_TCP);
    if (!BindSocket(listener, 0, kLoopback) || !ListenSocket(listener, 8)) return 1;
    _SocketAddress* address = GetSocketAddress(listener);
    auto port = static_cast<uint16_t>(SocketAddressGetPort(address));
    DeleteSocketAddress(address);
    std::thread([listener] {
        for (;;) {
            auto* app = new RemoteApp("client", 0, nullptr);
            app->Connect(AcceptSocket(listener));
            app->Recycle();  // which its run holds from here on
        }
    }).detach();
    if (send(0, &port, sizeof(port), MSG_NOSIGNAL) != sizeof(port)) return 1;
    char end;
    while (recv(0, &end, 1, 0) > 0) continue;
    _exit(0);
}

class OtherProcess {
public:
    OtherProcess() {
        int ends[2];
        if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends)) return;
        m_Control = ends[0];
        const char* arguments[] = {"luaremote_bench", kServe, nullptr};
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, ends[1], 0);
        posix_spawn(&m_Process, "/proc/self/exe", &actions, nullptr, const_cast<char**>(arguments),
                    environ);
        posix_spawn_file_actions_destroy(&actions);
        close(ends[1]);
        if (recv(m_Control, &m_Port, sizeof(m_Port), MSG_WAITALL) != sizeof(m_Port)) m_Port = 0;
    }
    OtherProcess(const OtherProcess&) = delete;
    OtherProcess& operator=(const OtherProcess&) = delete;
    ~OtherProcess() {
        close(m_Control);
        if (m_Process > 0) waitpid(m_Process, nullptr, 0);
    }
    uint16_t GetPort() const { return m_Port; }

private:
    int m_Control = -1;
    pid_t m_Process = 0;
    uint16_t m_Port = 0;
};

// The calling end of a connection.
class Client {
public:
    Client() : m_App(new RemoteApp("near", 0, nullptr)) { m_App->SetTimeOut(60); }
    Client(const Client&) = delete;
    Client& operator=(const Client&) = delete;
    ~Client() {
        for (RemoteApp* app : {m_App, m_Peer}) {
            if (!app) continue;
            app->_Disconnect(0xffffffff);
            app->Recycle();
        }
    }

    bool ConnectTo(uint16_t port) {
        Platform::_Socket* socket = Platform::NewSocket(Platform::ST_TCP);
        if (Platform::ConnectSocket(socket, port, kLoopback)) return m_App->Connect(socket);
        Platform::DeleteSocket(socket);
        return false;
    }
    bool ConnectHere() {
        m_Peer = new RemoteApp("far", 0, nullptr);
        return RemoteApp::Join(m_App, m_Peer);
    }
    ScriptVal GetObject() { return m_App->FindRemoteObject(1); }

private:
    RemoteApp* m_App;
    RemoteApp* m_Peer = nullptr;  // in the same process
};

bool CallNative(RemoteObject* object, double number) {
    ScriptArgs look;
    look[0] = "Foo";
    ScriptVal found;
    if (!object->DoCommand(SST_GetTable, look, found)) return false;
    ScriptArgs args;
    args.SetArguments(number);
    args.SetPosition(0, found.FindKeyConst(-1));
    ScriptVal result;
    return object->DoCommand(SST_CallFunction, args, result) &&
           result.FindKeyConst(-1).ToNumber() == number;
}

void TimeNative(benchmark::State& state, const ScriptVal& object) {
    double number = 0;
    for (auto _ : state) {
        if (!CallNative(object.ToRemoteObject(), ++number)) {
            state.SkipWithError("no answer");
            break;
        }
    }
}

// The loop runs in Lua, a batch at a time, and is compiled but once.
void TimeLua(benchmark::State& state, const ScriptVal& object) {
    using namespace KorvelScript;
    constexpr int kBatch = 100;
    ScriptState* lua = g_LuaScriptLanguage->NewState(nullptr, STF_NoThread);
    lua->_SetGlobal("object", object, 0);
    lua->_SetGlobal("batch", kBatch, 0);
    lua->_Execute(
        "function run()\n"
        "    for i = 1, batch do if object:Foo(i) ~= i then error('no answer') end end\n"
        "end",
        0, "bench");
    while (state.KeepRunningBatch(kBatch)) {
        if (lua->_Execute("run()", 0, "bench") != SRES_Done) {
            state.SkipWithError("no answer");
            break;
        }
    }
    lua->Recycle();
}

// The two connections. Both variants of a row use the same one: how threads take turns on one
// processor stays as it happens to begin, and makes more of a difference than what is compared.
struct Session {
    Session() { m_IsReady = m_There.ConnectTo(m_Process.GetPort()) && m_Here.ConnectHere(); }

    OtherProcess m_Process;
    Client m_There;
    Client m_Here;
    bool m_IsReady;
};

void Register(Session& session) {
    struct Row {
        const char* m_Name;
        Client& m_Client;
        void (*m_Run)(benchmark::State& state, const ScriptVal& object);
    };
    const Row rows[] = {
        {"object:Foo(1), another process@lua", session.m_There, TimeLua},
        {"object:Foo(1), another process@native", session.m_There, TimeNative},
        {"object:Foo(1), the same process@lua", session.m_Here, TimeLua},
        {"object:Foo(1), the same process@native", session.m_Here, TimeNative},
    };
    for (const Row& row : rows) {
        benchmark::RegisterBenchmark(row.m_Name, [row](benchmark::State& state) {
            row.m_Run(state, row.m_Client.GetObject());
        })->UseRealTime();
    }
}

// Children inherit it.
void StayOnOneProcessor() {
    cpu_set_t processors;
    CPU_ZERO(&processors);
    CPU_SET(static_cast<size_t>(sched_getcpu()), &processors);
    sched_setaffinity(0, sizeof(processors), &processors);
}

}  // namespace
}  // namespace Korvel::Bench

int main(int argc, char** argv) {
    using namespace Korvel;
    using namespace Korvel::Bench;
    if (argc == 2 && strcmp(argv[1], kServe) == 0) return Serve();
    StayOnOneProcessor();
    KorvelScript::InitLanguages(TagList());
    InstallConfig();
    int result;
    {
        Session session;
        if (!session.m_IsReady) {
            fprintf(stderr, "no connection\n");
            return 1;
        }
        // A connection through which nothing is held would end between two rows.
        ScriptVal kept[] = {session.m_There.GetObject(), session.m_Here.GetObject()};
        Register(session);
        result = RunComparison(argc, argv);
    }
    KorvelScript::CleanupLanguages();
    return result;
}

// What a script state costs beside the bare interpreter and the bare hand-off between two threads.
#include <pthread.h>

#include <chrono>
#include <lua.hpp>
#include <thread>

#include "Compare.h"
#include "core/TagList.h"
#include "runtime/Script.h"
#include "runtime/ScriptLanguage.h"

namespace {

using namespace Korvel;
using namespace Korvel::KorvelScript;

constexpr char kLoop[] = "local sum = 0 for i = 1, 1e7 do sum = sum + i % 7 end return sum";

// Times one step of each iteration, and leaves the rest out.
template <class Step>
auto Timed(benchmark::State& state, Step&& step) {
    auto start = std::chrono::steady_clock::now();
    auto result = step();
    std::chrono::duration<double> passed = std::chrono::steady_clock::now() - start;
    state.SetIterationTime(passed.count());
    return result;
}

lua_State* OpenBare() {
    lua_State* L = luaL_newstate();
    luaL_openlibs(L);
    return L;
}

void Create(benchmark::State& state, unsigned int flags) {
    for (auto _ : state) {
        Timed(state, [=] { return g_LuaScriptLanguage->NewState(nullptr, flags); })->Recycle();
    }
}

void CreateBare(benchmark::State& state) {
    for (auto _ : state) lua_close(Timed(state, OpenBare));
}

void TakeFromPool(benchmark::State& state) {
    TagList tags;
    g_LuaScriptLanguage->GetState(tags)->Done();
    for (auto _ : state) {
        Timed(state, [&] { return g_LuaScriptLanguage->GetState(tags); })->Done();
    }
}

void RoundTrip(benchmark::State& state) {
    ScriptState* script = g_LuaScriptLanguage->NewState(nullptr, 0);
    for (auto _ : state) script->Execute("");
    script->Recycle();
}

// A thread that takes requests under a mutex, one at a time, and a caller that waits for the
// answer.
class BareServer {
public:
    BareServer() : m_Thread([this] { Serve(); }) {}
    ~BareServer() {
        Ask(kStop);
        m_Thread.join();
    }
    void Ask(int request) {
        pthread_mutex_lock(&m_Mutex);
        m_Request = request;
        pthread_cond_signal(&m_HasRequest);
        while (m_Request) pthread_cond_wait(&m_HasAnswer, &m_Mutex);
        pthread_mutex_unlock(&m_Mutex);
    }

    static constexpr int kWork = 1;
    static constexpr int kStop = 2;

private:
    void Serve() {
        pthread_mutex_lock(&m_Mutex);
        for (int request = 0; request != kStop;) {
            while (!m_Request) pthread_cond_wait(&m_HasRequest, &m_Mutex);
            request = m_Request;
            m_Request = 0;
            pthread_cond_signal(&m_HasAnswer);
        }
        pthread_mutex_unlock(&m_Mutex);
    }

    pthread_mutex_t m_Mutex = PTHREAD_MUTEX_INITIALIZER;
    pthread_cond_t m_HasRequest = PTHREAD_COND_INITIALIZER;
    pthread_cond_t m_HasAnswer = PTHREAD_COND_INITIALIZER;
    int m_Request = 0;
    std::thread m_Thread;
};

void RoundTripBare(benchmark::State& state) {
    BareServer server;
    for (auto _ : state) server.Ask(BareServer::kWork);
}

void CompiledLoop(benchmark::State& state) {
    ScriptState* script = g_LuaScriptLanguage->NewState(nullptr, 0);
    for (auto _ : state) {
        if (script->Execute(kLoop) != 0) state.SkipWithError("the loop failed");
        script->CollectGarbage();
    }
    script->Recycle();
}

void CompiledLoopBare(benchmark::State& state) {
    lua_State* L = OpenBare();
    for (auto _ : state) {
        if (luaL_dostring(L, kLoop) != 0) state.SkipWithError("the loop failed");
        lua_settop(L, 0);
        lua_gc(L, LUA_GCCOLLECT, 0);
    }
    lua_close(L);
}

template <class Body>
benchmark::internal::Benchmark* Add(const char* name, Body body) {
    return benchmark::RegisterBenchmark(name, body);
}

}  // namespace

int main(int argc, char** argv) {
    InitLanguages(TagList());
    auto create = [](benchmark::State& state) { Create(state, STF_NoThread); };
    auto createWithThread = [](benchmark::State& state) { Create(state, 0); };
    Add("new state@korvelscript", create)->UseManualTime();
    Add("new state@bare", CreateBare)->UseManualTime();
    Add("new state with its thread@korvelscript", createWithThread)->UseManualTime();
    Add("state from the pool@korvelscript", TakeFromPool)->UseManualTime();
    Add("round trip@korvelscript", RoundTrip)->UseRealTime();
    Add("round trip@bare", RoundTripBare)->UseRealTime();
    Add("compiled loop of 10 million@korvelscript", CompiledLoop)->UseRealTime();
    Add("compiled loop of 10 million@bare", CompiledLoopBare)->UseRealTime();
    int result = Korvel::Bench::RunComparison(argc, argv);
    CleanupLanguages();
    return result;
}

// What a new interpreter costs: the library's own beside one with Lua's standard libraries alone,
// and the steps in between.
#include <lua.hpp>

#include "Compare.h"
#include "runtime/lua/KRScriptLib.h"

namespace {

void OpenOurs(lua_State* L) {
    Korvel::OpenAllLibs(L);
}

// Without LPeg, and with the standard libraries that the user has opened.
void OpenRequired(lua_State* L) {
    luaL_openlibs(L);
    luaopen_krscript(L);
}

void NewInterpreter(benchmark::State& state, void (*open)(lua_State*)) {
    for (auto _ : state) {
        lua_State* L = luaL_newstate();
        open(L);
        Korvel::CloseInterpreter(L);
    }
}

BENCHMARK_CAPTURE(NewInterpreter, all, OpenOurs)->Name("new interpreter@all libraries");
BENCHMARK_CAPTURE(NewInterpreter, host, OpenRequired)->Name("new interpreter@without lpeg");
BENCHMARK_CAPTURE(NewInterpreter, bare, luaL_openlibs)->Name("new interpreter@luaL_openlibs");

}  // namespace

int main(int argc, char** argv) {
    return Korvel::Bench::RunComparison(argc, argv);
}

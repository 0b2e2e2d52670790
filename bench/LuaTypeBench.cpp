// What the framework for Lua types adds to a call from a script: a member variable, a member
// function and a type test, beside a userdata bound by hand for one class, with a C function as
// `__index`. The loops run in Lua.
#include <cstring>
#include <lua.hpp>

#include "Compare.h"
#include "objects/LuaClass.h"
#include "runtime/lua/LuaType.h"

namespace {

using namespace Korvel;

struct Track {
    double m_Volume = 0.5;
    double m_Other = 1;
};

class LuaType_Track : public LuaTypeT<Track> {
public:
    using LuaTypeT::LuaTypeT;

    int lw_create(lua_State*) override { return 0; }

    int lwf_Other(lua_State* L, Track* track, LuaType*) {
        lua_pushnumber(L, track->m_Other);
        return 1;
    }
    int lwf_Scale(lua_State* L, Track* track, LuaType*) {
        lua_pushnumber(L, track->m_Volume * luaL_checknumber(L, 1));
        return 1;
    }
    int lwm_Other(lua_State* L, Track* track, LuaType*, bool) {
        lua_pushnumber(L, track->m_Other);
        return 1;
    }
    int lwm_Volume(lua_State* L, Track* track, LuaType*, bool) {
        lua_pushnumber(L, track->m_Volume);
        return 1;
    }

    static LuaFuncTable s_Functions[];
    static LuaMemberTable s_Members[];
};

LuaFuncTable LuaType_Track::s_Functions[] = {
    Func<&LuaType_Track::lwf_Other>("Play"),
    Func<&LuaType_Track::lwf_Other>("Stop"),
    Func<&LuaType_Track::lwf_Scale>("Scale"),
    {},
};
LuaMemberTable LuaType_Track::s_Members[] = {
    Member<&LuaType_Track::lwm_Other>("Title"),
    Member<&LuaType_Track::lwm_Other>("Length"),
    Member<&LuaType_Track::lwm_Volume>("Volume"),
    {},
};

LuaType_Track s_LuaType_Track("Track", &LuaClass::s_LuaType, LuaType_Track::s_Functions,
                              LuaType_Track::s_Members);

// The same by hand. Functions are remembered as upvalues.
constexpr char kHandName[] = "HandTrack";

Track* CheckTrack(lua_State* L) {
    return *static_cast<Track**>(luaL_checkudata(L, 1, kHandName));
}

int HandOther(lua_State* L) {
    lua_pushnumber(L, CheckTrack(L)->m_Other);
    return 1;
}

int HandScale(lua_State* L) {
    Track* track = CheckTrack(L);
    lua_pushnumber(L, track->m_Volume * luaL_checknumber(L, 2));
    return 1;
}

int HandIndex(lua_State* L) {
    Track* track = CheckTrack(L);
    const char* name = luaL_checkstring(L, 2);
    if (strcmp(name, "Title") == 0 || strcmp(name, "Length") == 0) {
        lua_pushnumber(L, track->m_Other);
    } else if (strcmp(name, "Volume") == 0) {
        lua_pushnumber(L, track->m_Volume);
    } else if (strcmp(name, "Play") == 0 || strcmp(name, "Stop") == 0) {
        lua_pushvalue(L, lua_upvalueindex(1));
    } else if (strcmp(name, "Scale") == 0) {
        lua_pushvalue(L, lua_upvalueindex(2));
    } else {
        lua_pushnil(L);
    }
    return 1;
}

void PushByFramework(lua_State* L, Track* track) {
    s_LuaType_Track.lw_register(L);
    s_LuaType_Track.lw_push(L, track);
}

void PushByHand(lua_State* L, Track* track) {
    *static_cast<Track**>(lua_newuserdata(L, sizeof(Track*))) = track;
    luaL_newmetatable(L, kHandName);
    lua_pushcfunction(L, HandOther);
    lua_pushcfunction(L, HandScale);
    lua_pushcclosure(L, HandIndex, 2);
    lua_setfield(L, -2, "__index");
    lua_setmetatable(L, -2);
}

using Push = void (*)(lua_State*, Track*);

// Runs a Lua loop of `object`'s use in batches.
template <Push push>
void Loop(benchmark::State& state, const char* body) {
    constexpr int kBatch = 10000;
    lua_State* L = luaL_newstate();
    luaL_openlibs(L);
    Track track;
    luaL_loadstring(L, body);
    push(L, &track);
    if (lua_pcall(L, 1, 1, 0) != 0) state.SkipWithError(lua_tostring(L, -1));
    while (state.KeepRunningBatch(kBatch)) {
        lua_pushvalue(L, -1);
        lua_pushnumber(L, kBatch);
        if (lua_pcall(L, 1, 0, 0) != 0) state.SkipWithError(lua_tostring(L, -1));
    }
    lua_close(L);
}

template <Push push>
void Variable(benchmark::State& state) {
    Loop<push>(state, R"(
        local object = ...
        return function(count)
            local sum = 0
            for i = 1, count do sum = sum + object.Volume end
            assert(sum == count * 0.5)
        end)");
}

template <Push push>
void Function(benchmark::State& state) {
    Loop<push>(state, R"(
        local object = ...
        return function(count)
            local sum = 0
            for i = 1, count do sum = sum + object:Scale(2) end
            assert(sum == count)
        end)");
}

// A native function that asks for the type of its argument.
template <Push push, class Test>
void TypeTest(benchmark::State& state, Test test) {
    lua_State* L = luaL_newstate();
    Track track;
    push(L, &track);
    lua_insert(L, 1);
    for (auto _ : state) {
        if (!test(L)) state.SkipWithError("wrong type");
    }
    lua_close(L);
}

void IsTypeByFramework(benchmark::State& state) {
    TypeTest<PushByFramework>(state, [](lua_State* L) { return lua_istype(L, 1, "Track"); });
}

void IsTypeByHand(benchmark::State& state) {
    TypeTest<PushByHand>(state, [](lua_State* L) { return luaL_checkudata(L, 1, kHandName); });
}

// Without the error that luaL_checkudata raises, and by the functions of Lua 5.1.
void IsTypeQuietly(benchmark::State& state) {
    TypeTest<PushByHand>(state, [](lua_State* L) {
        if (!lua_touserdata(L, 1) || !lua_getmetatable(L, 1)) return false;
        lua_getfield(L, LUA_REGISTRYINDEX, kHandName);
        bool same = lua_rawequal(L, -1, -2);
        lua_pop(L, 2);
        return same;
    });
}

void IsParentByFramework(benchmark::State& state) {
    TypeTest<PushByFramework>(state, [](lua_State* L) { return lua_istype(L, 1, "LuaClass"); });
}

void PushAgain(benchmark::State& state) {
    Track track;
    TypeTest<PushByFramework>(state, [&](lua_State* L) {
        s_LuaType_Track.lw_push(L, &track);
        lua_settop(L, 1);
        return true;
    });
}

}  // namespace

int main(int argc, char** argv) {
    benchmark::RegisterBenchmark("obj.Var@framework", Variable<PushByFramework>);
    benchmark::RegisterBenchmark("obj.Var@by hand", Variable<PushByHand>);
    benchmark::RegisterBenchmark("obj:Func(x)@framework", Function<PushByFramework>);
    benchmark::RegisterBenchmark("obj:Func(x)@by hand", Function<PushByHand>);
    benchmark::RegisterBenchmark("lua_istype@framework", IsTypeByFramework);
    benchmark::RegisterBenchmark("lua_istype@by hand", IsTypeByHand);
    benchmark::RegisterBenchmark("lua_istype@by hand, no error", IsTypeQuietly);
    benchmark::RegisterBenchmark("lua_istype, a parent@framework", IsParentByFramework);
    benchmark::RegisterBenchmark("pushing a known object@framework", PushAgain);
    return Korvel::Bench::RunComparison(argc, argv);
}

#include "runtime/lua/LuaType.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <lua.hpp>
#include <stdexcept>
#include <string>

#include "objects/LuaClass.h"

namespace Korvel {
namespace {

int s_Used = 0;
int s_Recycled = 0;

// A deck holds its motor behind other data, so that the two types see different addresses.
struct Motor {
    double m_Speed = 1;
};
struct Deck {
    double m_Volume = 0.5;
    Motor m_Motor;
};

class LuaType_Motor : public LuaTypeT<Motor> {
public:
    using LuaTypeT::LuaTypeT;

    void* lw_to_type(void* deck) override { return &static_cast<Deck*>(deck)->m_Motor; }
    void* lw_from_type(void* motor) override {
        return static_cast<char*>(motor) - offsetof(Deck, m_Motor);
    }

    int lw_create(lua_State*) override { throw std::runtime_error("a motor wants a deck"); }

    int lwf_Spin(lua_State* L, Motor* motor, LuaType* type) {
        lua_pushfstring(L, "%s %f %d", type->GetName(), motor->m_Speed, lua_gettop(L));
        return 1;
    }
    int lwm_Speed(lua_State* L, Motor* motor, LuaType*, bool set) {
        if (set) motor->m_Speed = lua_tonumber_def(L, 1, -1);
        lua_pushnumber(L, motor->m_Speed);
        return set ? 0 : 1;
    }
    static LuaFuncTable s_Functions[];
    static LuaMemberTable s_Members[];
};
LuaFuncTable LuaType_Motor::s_Functions[] = {
    Func<&LuaType_Motor::lwf_Spin>("Spin"), Func<&LuaType_Motor::lwf_Spin>("Volume"), {}};
LuaMemberTable LuaType_Motor::s_Members[] = {
    Member<&LuaType_Motor::lwm_Speed>("Speed"), Member<&LuaType_Motor::lwm_Speed>("Throw"), {}};
LuaType_Motor s_Motor("Motor", &LuaClass::s_LuaType, LuaType_Motor::s_Functions,
                      LuaType_Motor::s_Members);

class LuaType_Deck : public LuaTypeT<Deck> {
public:
    using LuaTypeT::LuaTypeT;

    int lw_create(lua_State* L) override { return lw_push(L, new Deck); }
    int lw_use(lua_State* L, void*, LuaType*) override {
        if (m_RefuseUse) throw std::runtime_error("not for you");
        s_Used++;
        return 0;
    }
    int lw_recycle(lua_State*, void* object, LuaType*) override {
        s_Recycled++;
        delete Self(object);
        return 0;
    }
    int lw_index(lua_State* L, void*, LuaType*) override {
        lua_pushfstring(L, "index %s", luaL_typename(L, 1));
        return 1;
    }
    int lw_newindex(lua_State* L, void*, LuaType*) override {
        return luaL_error(L, "newindex %s %s", luaL_typename(L, 1), luaL_typename(L, 2));
    }
    int lw_call(lua_State* L, void*, LuaType*) override {
        lua_pushfstring(L, "%s %d", luaL_typename(L, 1), lua_gettop(L));
        return 1;
    }
    int lw_add(lua_State* L, void*, LuaType*) override {
        lua_pushfstring(L, "plus %s", luaL_typename(L, 1));
        return 1;
    }
    // Collects garbage while nothing else may hold the object.
    int lw_concat(lua_State* L, void*, LuaType*) override {
        int before = s_Recycled;
        lua_gc(L, LUA_GCCOLLECT, 0);
        lua_gc(L, LUA_GCCOLLECT, 0);
        lua_pushboolean(L, s_Recycled == before);
        return 1;
    }

    int lwf_Throw(lua_State*, Deck*, LuaType*) { throw std::runtime_error("thrown 100%s"); }
    int lwm_Volume(lua_State* L, Deck* deck, LuaType*, bool set) {
        if (set) deck->m_Volume = lua_tonumber_def(L, 1, -1);
        lua_pushnumber(L, deck->m_Volume);
        return set ? 0 : 1;
    }
    static LuaFuncTable s_Functions[];
    static LuaMemberTable s_Members[];

    bool m_RefuseUse = false;
};
LuaFuncTable LuaType_Deck::s_Functions[] = {Func<&LuaType_Deck::lwf_Throw>("Throw"), {}};
LuaMemberTable LuaType_Deck::s_Members[] = {Member<&LuaType_Deck::lwm_Volume>("Volume"), {}};
LuaType_Deck s_Deck("Deck", &s_Motor, LuaType_Deck::s_Functions, LuaType_Deck::s_Members);

class LuaTypeTest : public testing::Test {
protected:
    LuaTypeTest() {
        s_Used = s_Recycled = 0;
        luaL_openlibs(L);
        s_Deck.lw_register(L);
        s_Motor.lw_register(L);
    }
    ~LuaTypeTest() override {
        lua_close(L);
        EXPECT_EQ(s_Used, s_Recycled);
    }

    // The results of a text as one text, or its error.
    std::string Run(const char* text) {
        lua_settop(L, 0);
        if (luaL_loadstring(L, text) == 0) lua_pcall(L, 0, LUA_MULTRET, 0);
        std::string all;
        for (int i = 1; i <= lua_gettop(L); i++) {
            lua_getglobal(L, "tostring");
            lua_pushvalue(L, i);
            lua_call(L, 1, 1);
            all += (i > 1 ? " " : "") + std::string(lua_tostring(L, -1));
            lua_pop(L, 1);
        }
        return all;
    }

    lua_State* L = luaL_newstate();
};

TEST_F(LuaTypeTest, HashesNames) {
    EXPECT_EQ(gethash(nullptr), 0u);
    EXPECT_EQ(gethash(""), 0u);
    EXPECT_EQ(gethash("a"), 0xFFFFFF9Eu);
    EXPECT_EQ(gethash("ab"), 0x1FFFCF0Fu);
    EXPECT_EQ(gethash("LastError"), 0xFCDE0A24u);
    EXPECT_EQ(gethash("\xC3\xA9"), 0xFFFFE192u);  // characters are signed
    EXPECT_EQ(LuaType_Deck::s_Members[0].m_Hash, gethash("Volume"));
}

TEST_F(LuaTypeTest, FindsNames) {
    struct Case {
        const char* text;
        const char* result;
    };
    const Case cases[] = {
        {"return d.Volume, d.Speed", "0.5 1"},
        {"d.Volume = 2 d.Speed = 3 return d.Volume, d.Speed", "2 3"},
        {"d.Speed = nil return d.Speed", "-1"},
        {"return d:Spin(1, 2)", "Deck 1 2"},  // a parent's function sees its own part
        {"local f = d.Spin return f(d), f == d.Spin", "Deck 1 0 true"},
        {"return pcall(d.Throw, d)", "false thrown 100%s"},  // goes before the parent's variable
        {"d.Throw = 4 return d.Speed", "4"},  // and hides it only where a function counts
        {"d.Spin = 1", "newindex string number"},
        {"d[1] = 1", "newindex number number"},
        {"return d[1], d[true], d['Volume\\0'], d.volume, d['']",
         "index number index boolean index string index string index string"},
        {"return d(1, 2), d + 1, d + d", "userdata 3 plus number plus userdata"},
        {"return 1 + d, 'x' .. d", "nil nil"},
        {"return -d", "Illegal operator"},
        {"return d < d", "Illegal operator"},
        {"return d == class.Deck(), d == d", "false true"},
        {"return (tostring(d):gsub('0x%x+', 'address'))", "Deck <address>"},
        {"return class.Motor()", "a motor wants a deck"},
        {"local m = getmetatable(d) return m._typename(d), m._istypeof(d, 'Motor'), "
         "m._istypeof(d, 'Deck'), m._istypeof(d, 'LuaClass'), m._istypeof(d, 'x'), m._istypeof(d)",
         "Deck true true true false false"},
    };
    for (const Case& c : cases) {
        std::string result = Run((std::string("local d = class.Deck() ") + c.text).c_str());
        size_t place = result.find(":1: ");  // where an error was raised
        EXPECT_EQ(place == std::string::npos ? result : result.substr(place + 4), c.result)
            << c.text;
    }
}

TEST_F(LuaTypeTest, WantsAColon) {
    const char* error = "Member functions must be called with a ':', not a '.'";
    for (const char* call : {"a.Spin(1)", "a.Spin(b)", "a.Spin()", "a.Spin(io.stdout)"}) {
        std::string text = std::string("local a, b = class.Deck(), class.Deck() return ") + call;
        EXPECT_NE(Run(text.c_str()).find(error), std::string::npos) << call;
    }
}

// Every metamethod with everything that a script has at hand.
TEST_F(LuaTypeTest, BelievesNoFirstArgument) {
    EXPECT_EQ(Run(R"(
        local deck, released = class.Deck(), class.Deck()
        local spin = released.Spin
        local mt = getmetatable(deck)
        mt.__gc(released)
        mt.__gc(released)
        local others = {1, 'x', {}, print, coroutine.create(print), io.stdout, newproxy(true),
                        newproxy(), setmetatable({}, mt), released, false, n = 11}
        for name, f in pairs(mt) do
            for i = 1, others.n do
                for _, key in ipairs{'Volume', 'Spin', 'x', 1} do
                    assert(select('#', f(others[i], key, 1)) == 0, name)
                end
            end
            assert(select('#', f()) == 0 and select('#', f(nil, deck)) == 0, name)
            if name ~= '__gc' then pcall(f, deck) pcall(f, deck, nil, nil, nil, nil) end
        end
        return select('#', spin(released)), mt.__index(deck), deck.Volume)"),
              "0 index nil 0.5");
    EXPECT_EQ(s_Recycled, 1);
}

TEST_F(LuaTypeTest, KeepsTheObjectWhileAnOperationRuns) {
    EXPECT_EQ(Run("local mt = getmetatable(class.Deck()) "
                  "return (select(2, pcall(mt.__concat, class.Deck(), 1)))"),
              "true");
}

TEST_F(LuaTypeTest, OneUserdataForAnObject) {
    auto deck = new Deck;
    s_Deck.lw_push(L, deck);
    s_Deck.lw_push(L, deck);
    s_Motor.lw_push(L, &deck->m_Motor);  // as one of its parents sees it
    EXPECT_TRUE(lua_rawequal(L, 1, 2) && lua_rawequal(L, 1, 3));
    EXPECT_EQ(s_Used, 1);
    EXPECT_EQ(lua_totype(L, 1, "Deck"), deck);
    EXPECT_EQ(lua_totype(L, -1, "Motor"), &deck->m_Motor);
    EXPECT_EQ(lua_totype(L, 1, "LuaClass"), deck);
    EXPECT_EQ(lua_totype(L, 1, "Tape"), nullptr);

    // Functions that are remembered must not keep it.
    lua_setglobal(L, "d");
    EXPECT_EQ(Run("d:Spin() d = nil collectgarbage() collectgarbage()"), "");
    EXPECT_EQ(s_Recycled, 1);

    // A userdata that a script has released does not come back.
    deck = new Deck;
    s_Deck.lw_push(L, deck);
    lua_setglobal(L, "d");
    Run("getmetatable(d).__gc(d)");
    lua_getglobal(L, "d");
    EXPECT_FALSE(lua_istype(L, -1, "Deck"));
    Deck other;
    s_Deck.lw_push(L, deck, LWF_NoReference);
    EXPECT_FALSE(lua_rawequal(L, -1, -2));
    EXPECT_TRUE(lua_istype(L, -1, "Deck"));
    EXPECT_EQ(s_Used, 2);

    // Another type's object at the same address.
    static LuaType_Deck unrelated("Unrelated", nullptr, nullptr, nullptr);
    lua_pushLuaObject(L, &other, &s_Deck, LWF_NoReference);
    lua_pushLuaObject(L, &other, &unrelated, LWF_NoReference);  // never registered
    EXPECT_TRUE(lua_istype(L, -1, "Unrelated") && lua_istype(L, -2, "Motor"));
    EXPECT_EQ(s_Deck.lw_push(L, nullptr), 1);
    EXPECT_TRUE(lua_isnil(L, -1));
    lua_settop(L, 0);
    lua_gc(L, LUA_GCCOLLECT, 0);
}

TEST_F(LuaTypeTest, OtherValuesHaveNoType) {
    Run("return 1, {}, newproxy(), newproxy(true), io.stdout, 'Deck', nil");
    int value = 0;
    lua_pushlightuserdata(L, &value);
    lua_newtable(L);
    lua_setfield(L, LUA_REGISTRYINDEX, "of the host");
    lua_pushobject(L, &value, "of the host");
    for (int i = 1; i <= lua_gettop(L) + 1; i++) EXPECT_FALSE(lua_istype(L, i, "Deck")) << i;
    lua_pushobject(L, &value, nullptr);
    EXPECT_TRUE(lua_rawequal(L, -1, -2));
    EXPECT_FALSE(lua_istype(L, -1, nullptr));
    // lua_pushobject's userdata would pass for one of the type's.
    auto misuse = [](lua_State* state) {
        lua_pushobject(state, state, "Deck");
        return 0;
    };
    EXPECT_NE(lua_cpcall(L, misuse, nullptr), 0);
    Run("getmetatable(io.stdout)._istypeof = function() return true end return io.stdout");
    EXPECT_FALSE(lua_istype(L, 1, "Deck"));
    lua_settop(L, 0);
}

// Each operator reaches the operation of its own name.
TEST_F(LuaTypeTest, OperatorsReachTheirOperations) {
    class Echo : public LuaTypeT<int> {
    public:
        using LuaTypeT::LuaTypeT;
        int lw_create(lua_State*) override { return 0; }
        static int Say(lua_State* L, const char* name) { return lua_pushstring(L, name), 1; }
        int lw_add(lua_State* L, void*, LuaType*) override { return Say(L, "add"); }
        int lw_sub(lua_State* L, void*, LuaType*) override { return Say(L, "sub"); }
        int lw_mul(lua_State* L, void*, LuaType*) override { return Say(L, "mul"); }
        int lw_div(lua_State* L, void*, LuaType*) override { return Say(L, "div"); }
        int lw_pow(lua_State* L, void*, LuaType*) override { return Say(L, "pow"); }
        int lw_unm(lua_State* L, void*, LuaType*) override { return Say(L, "unm"); }
        int lw_concat(lua_State* L, void*, LuaType*) override { return Say(L, "concat"); }
        int lw_call(lua_State* L, void*, LuaType*) override { return Say(L, "call"); }
        int lw_index(lua_State* L, void*, LuaType*) override { return Say(L, "index"); }
        int lw_tostring(lua_State* L, void*, LuaType*) override { return Say(L, "tostring"); }
        int lw_lt(lua_State* L, void*, LuaType*) override { return lua_pushboolean(L, true), 1; }
        int lw_le(lua_State* L, void*, LuaType*) override { return lua_pushboolean(L, false), 1; }
    };
    static Echo echo("Echo", &LuaClass::s_LuaType, nullptr, nullptr);
    static int object;
    echo.lw_push(L, &object);
    lua_setglobal(L, "e");
    EXPECT_EQ(Run("return e + 1, e - 1, e * 1, e / 1, e ^ 1, -e, e .. 1, e(), e[1], tostring(e), "
                  "e < e, e <= e, e == e"),
              "add sub mul div pow unm concat call index tostring true false true");
}

TEST_F(LuaTypeTest, RegistersAgain) {
    Run("old, oldNew = class.Deck(), class.Deck class = 7");
    s_Deck.lw_register(L);
    EXPECT_EQ(Run("local new = class.Deck() "
                  "return class.Deck == oldNew, getmetatable(old) == getmetatable(new), "
                  "new:Spin(), old:Spin(), old == new"),
              "false false Deck 1 0 Deck 1 0 false");
    lua_newtable(L);
    s_Deck.lw_register(L, -1);
    lua_setglobal(L, "mine");
    EXPECT_EQ(Run("return mine.Deck().Volume"), "0.5");
    bool listed = false;
    for (_LuaType* type = g_LuaTypeList; type; type = type->GetNext()) listed |= type == &s_Deck;
    EXPECT_TRUE(listed);
}

TEST_F(LuaTypeTest, AFailedReferenceIsNotGivenBack) {
    Deck deck;
    s_Deck.m_RefuseUse = true;
    lua_pushlightuserdata(L, &deck);
    auto push = [](lua_State* state) { return s_Deck.lw_push(state, lua_touserdata(state, 1)); };
    EXPECT_NE(lua_cpcall(L, push, &deck), 0);
    EXPECT_NE(std::string(lua_tostring(L, -1)).find("not for you"), std::string::npos);
    s_Deck.m_RefuseUse = false;
    lua_gc(L, LUA_GCCOLLECT, 0);
    EXPECT_EQ(s_Recycled, 0);
}

// Lua's memory runs out after ever more allocations, at each step on the way once.
TEST_F(LuaTypeTest, SurvivesWithoutMemory) {
    long left = 0;
    auto allocate = [](void* user, void* block, size_t oldSize, size_t size) -> void* {
        if (size == 0) return free(block), nullptr;
        if (size > oldSize && (*static_cast<long*>(user))-- <= 0) return nullptr;
        return realloc(block, size);
    };
    auto work = [](lua_State* state) {
        s_Deck.lw_register(state);
        auto deck = new Deck;
        int used = s_Used;
        struct Unpushed {
            Deck* m_Deck;
            int m_Used;
            ~Unpushed() {
                if (s_Used == m_Used) delete m_Deck;
            }
        } unpushed{deck, used};
        s_Deck.lw_push(state, deck);
        lua_setglobal(state, "d");
        if (luaL_loadstring(state, "local v = d.Volume d:Spin()") != 0) lua_error(state);
        lua_call(state, 0, 0);
        return 0;
    };
    int result = 1;
    for (long count = 0; result != 0; count++) {
        left = 1000000;
        lua_State* state = lua_newstate(allocate, &left);
        ASSERT_NE(state, nullptr);
        left = count;
        result = lua_cpcall(state, work, nullptr);
        left = 1000000;
        lua_close(state);
        ASSERT_EQ(s_Used, s_Recycled) << count;
    }
}

TEST_F(LuaTypeTest, Helpers) {
    Run("t = {Alpha = 1, Beta = 2, [1] = 3}");
    lw_flaunttable(L, "t", "Alpha");
    lw_flaunttable(L, "t", "none");
    lw_flaunttable(L, "nothing", nullptr);
    EXPECT_EQ(Run("return Alpha, Beta, none"), "1 nil nil");
    lw_flaunttable(L, "t", nullptr);
    EXPECT_EQ(Run("return Alpha, Beta, _G[1]"), "1 2 3");

    Run("return 5, '5', true, nil");
    EXPECT_EQ(lua_tonumber_def(L, 2, 7), 7);  // no conversions
    EXPECT_STREQ(lua_tostring_def(L, 1, "x"), "x");
    EXPECT_TRUE(lua_toboolean_def(L, 4, true));
    EXPECT_TRUE(lua_istrue(L, 1));
    EXPECT_FALSE(lua_istrue(L, 4) || lua_istrue(L, 5));
    EXPECT_EQ(lua_absindex(L, -1), 4);
    EXPECT_EQ(lua_absindex(L, 2), 2);
    EXPECT_EQ(lua_absindex(L, LUA_GLOBALSINDEX), LUA_GLOBALSINDEX);
}

}  // namespace
}  // namespace Korvel

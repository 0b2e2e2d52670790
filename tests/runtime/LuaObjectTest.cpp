// Objects in scripts, over a socket and within the process.
#include "runtime/lua/LuaObject.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <lua.hpp>
#include <stdexcept>
#include <string>

#include "Platform/Networking.h"
#include "Platform/Time.h"
#include "core/FaultsInternal.h"
#include "core/RefObject.h"
#include "core/TagList.h"
#include "diag/Env.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "runtime/Script.h"
#include "runtime/ScriptLanguage.h"
#include "runtime/lua/LuaType.h"
#include "runtime/lua/LuaValues.h"

namespace Korvel {
namespace {

using KorvelScript::ScriptState;

ScriptState* s_State;
std::string s_Printed;

// What arrives at a member, in one line.
std::string Describe(const ScriptVal& value) {
    switch (value.Type()) {
        case SV_Number:
            return std::to_string(value.ToInteger());
        case SV_String:
            return value.ToString();
        case SV_LocalObject:
            return "local";
        case SV_RemoteObject:
            return value.IsLocalObject(false) ? "remote and local" : "remote";
        case SV_Code:
            return "code";
        case SV_MemBlock:
            return "block";
        case SV_Table:
            return "table";
        default:
            return value.IsNil() ? "nil" : "?";
    }
}

// It lives as long as somebody counts it.
class Board : public Scripted<_Object> {
    KORVEL_SCRIPTED(Board)
public:
    Board() {
        SetScriptClass();
        s_NumAlive++;
    }
    ~Board() override { s_NumAlive--; }
    void IncRef() override { m_Count++; }
    void DecRef() override {
        if (--m_Count == 0) delete this;
    }

    // Returns the operation and its arguments.
    void Tell(ScriptArgs& args, const ScriptSymbol* symbol) {
        std::string text = SSTName[symbol->GetKind() - SST_FirstOpcode];
        TableEntry* entry = args.m_Value.m_Args.m_Table;
        for (; entry; entry = entry->m_Next) {
            text += ' ';
            text += Describe(entry->m_Key);
            text += '=';
            text += Describe(entry->m_Value);
        }
        args.ReturnString(text.c_str());
    }

    static inline std::atomic<int> s_NumAlive{0};
    static inline std::atomic<int> s_NumRuns{0};

private:
    double m_Speed = 1;
    ScriptVal m_Kept;
    std::atomic<int> m_Count{1};
};

KORVEL_PUBLISH(Board, "Board", "Tells what it gets.", "")
KORVEL_OPCODE(Board, SST_Call, SSF_AnyThread) {
    self.Tell(args, symbol);
}
KORVEL_OPCODE(Board, SST_Add, SSF_AnyThread) {
    self.Tell(args, symbol);
}
KORVEL_OPCODE(Board, SST_Sub, SSF_AnyThread) {
    self.Tell(args, symbol);
}
KORVEL_OPCODE(Board, SST_Mul, SSF_AnyThread) {
    self.Tell(args, symbol);
}
KORVEL_OPCODE(Board, SST_Div, SSF_AnyThread) {
    self.Tell(args, symbol);
}
KORVEL_OPCODE(Board, SST_Pow, SSF_AnyThread) {
    self.Tell(args, symbol);
}
KORVEL_OPCODE(Board, SST_Unm, SSF_AnyThread) {
    self.Tell(args, symbol);
}
KORVEL_OPCODE(Board, SST_LT, SSF_AnyThread) {
    args.ReturnBoolean(args[1].IsLocalObject(false));
}
KORVEL_OPCODE(Board, SST_Concat, SSF_AnyThread) {
    self.Tell(args, symbol);
}
KORVEL_OPCODE(Board, SST_GetTableUnknown, SSF_AnyThread) {
    if (args[0].IsNumber()) self.Tell(args, symbol);
    if (args[0] == "Broken") args.SetError(SCERR_InvalidArgs, "no such name");
}
KORVEL_FUNCTION(Board, Echo, SSF_AnyThread) {
    Board::s_NumRuns++;
    for (int i = 1; args.Exists(i); i++) args.Return(args[i]);
}
KORVEL_FUNCTION(Board, Kinds, SSF_AnyThread) {
    std::string text;
    for (int i = 1; args.Exists(i); i++) text += Describe(args[i]) + ';';
    args.ReturnString(text.c_str());
}
KORVEL_FUNCTION(Board, Gap, SSF_AnyThread) {
    args.FindKey(-3) = 3;
    args.FindKey(-1) = 1;
    args.m_Value.m_Args.m_NumReturns = 3;
}
KORVEL_FUNCTION(Board, Make, SSF_AnyThread) {
    Board* made = new Board;
    if (!made) return;
    args.ReturnObject(made);
    made->DecRef();
}
KORVEL_FUNCTION(Board, Fail, SSF_AnyThread) {
    args.SetError(SCERR_InvalidArgs, "told");
}
KORVEL_FUNCTION(Board, Keep, SSF_AnyThread) {
    self.m_Kept = args[1];
}
KORVEL_FUNCTION(Board, Kept, SSF_AnyThread) {
    args.Return(self.m_Kept);
}
KORVEL_FUNCTION(Board, RunHere, SSF_AnyThread) {
    args.ReturnNumber(s_State->Execute(args[1].ToString()));
}
KORVEL_FUNCTION(Board, Throw, SSF_AnyThread) {
    throw std::runtime_error("thrown");
}
KORVEL_VARIABLE(Board, Speed, SSF_Read | SSF_Write | SSF_AnyThread) {
    if (set) {
        self.m_Speed = args[1].ToNumber();
    } else {
        args.ReturnNumber(self.m_Speed);
    }
}
KORVEL_PUBLISHED(Board);

// The two ends of a TCP connection of this machine.
void ConnectBySocket(RemoteApp* near, RemoteApp* far) {
    using namespace Platform;
    constexpr unsigned int kLoopback = 0x0100007F;  // 127.0.0.1 in network order
    _Socket* listener = NewSocket(ST_TCP);
    ASSERT_TRUE(BindSocket(listener, 0, kLoopback) && ListenSocket(listener, 0));
    _SocketAddress* address = GetSocketAddress(listener);
    _Socket* socket = NewSocket(ST_TCP);
    ASSERT_TRUE(ConnectSocket(socket, SocketAddressGetPort(address), kLoopback));
    ASSERT_TRUE(near->Connect(socket) && far->Connect(AcceptSocket(listener)));
    DeleteSocketAddress(address);
    DeleteSocket(listener);
}

class LuaObjectTest : public testing::TestWithParam<bool> {
protected:
    LuaObjectTest() {
        s_Root = new Board;
        m_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_Root; };
        g_ScriptConfig = &m_Config;
        m_Near = new RemoteApp("near", 0, nullptr);
        m_Far = new RemoteApp("far", 0x0100007F, nullptr);
        if (IsJoined()) {
            EXPECT_TRUE(RemoteApp::Join(m_Near, m_Far));
        } else {
            ConnectBySocket(m_Near, m_Far);
        }
        KorvelScript::InitLanguages(TagList());
        s_State = KorvelScript::g_LuaScriptLanguage->NewState(nullptr, 0);
        auto print = [](void*, const char* text) { s_Printed += text; };
        s_State->SetPrintFuncs(print, print, nullptr);
        // The error of a call, without its place.
        s_State->Execute(R"(
            function try(...)
                local isDone, message = pcall(...)
                return (message:gsub('^%[string "t"%]:%d+: ', ''))
            end)");
        s_State->SetGlobal("app", m_Near->FindRemoteObject(1));
    }
    ~LuaObjectTest() override {
        if (s_State) EndState();
        KorvelScript::CleanupLanguages();
        for (RemoteApp* app : {m_Near, m_Far}) app->_Disconnect(0xffffffff);
        for (RemoteApp* app : {m_Near, m_Far}) Release(app);
        EXPECT_EQ(Board::s_NumAlive, 1);
        s_Root->DecRef();
        g_ScriptConfig = nullptr;
    }

    // A connection that ends by itself cleans up on its own thread.
    static void Release(RemoteApp* app) {
        for (int i = 0; app->GetUseCount() > 1 && i < 60000; i++) Platform::Wait(1);
        EXPECT_EQ(app->GetUseCount(), 1u);
        app->Recycle();
    }

    static bool IsJoined() { return GetParam(); }

    static void EndState() {
        s_State->Recycle();
        s_State = nullptr;
    }

    // What a text prints, errors too, without the last line end.
    static std::string Run(const std::string& text) {
        s_Printed.clear();
        s_State->Execute(text.c_str(), 0, "t");
        if (!s_Printed.empty()) s_Printed.pop_back();
        return s_Printed;
    }

    struct Case {
        const char* m_Script;
        const char* m_Printed;
    };
    template <size_t N>
    static void Check(const Case (&cases)[N]) {
        for (const Case& c : cases) EXPECT_EQ(Run(c.m_Script), c.m_Printed) << c.m_Script;
    }

    // A setting that loses its variable keeps its value, so tests end with the default.
    static void Set(const char* setting, const char* value) {
        setenv(setting, value, 1);
        EnvVar::InvalidateEnv();
    }

    // Gives the script an object of its own process as the global `here`.
    void MakeLocal(Board* board) {
        ScriptVal proxy = m_Near->FindRemoteObject(1);
        proxy.CallMember("Keep", board);
        EXPECT_EQ(Run("here = app:Kept() app:Keep()"), "");
    }

    static inline Board* s_Root;
    static inline RemoteApp* s_App;
    ScriptConfig m_Config;
    RemoteApp* m_Near;
    RemoteApp* m_Far;
};

TEST_P(LuaObjectTest, ExpressionsAreCommands) {
    const Case cases[] = {
        {"print(app(1, nil, 'x'))", "SST_Call 1=1 2=nil 3=x"},
        {"print(app())", "SST_Call"},
        {"print(app + 1, app - 'x', app * true)", "SST_Add 1=1\tSST_Sub 1=x\tSST_Mul 1=?"},
        {"print(app / {}, app ^ MemBlock(2))", "SST_Div 1=table\tSST_Pow 1=block"},
        {"print(-app, app .. 'x')", "SST_Unm\tSST_Concat 1=x"},
        {"print(1 + app, 'x' .. app)", "nil\tnil"},
        {"a, b = app:Make(), app:Make() print(a < b, a == b, a ~= app, a == a)",
         "true\tfalse\ttrue\ttrue"},
        {"print(app[7], app[-0.5])", "SST_GetTableUnknown 0=7\tSST_GetTableUnknown 0=0"},
        {"app.Speed = 12 print(app.Speed, app.Nothing)", "12\tnil"},
        {"print(select('#', app:Gap()), app:Gap())", "3\t1\tnil\t3"},
        {"print(select('#', app:Fail()))", "0"},
        {"local f = app.Echo print(f(app, 1, nil, 'x'))", "1\tnil\tx"},
        {"print(select('#', app.Echo(1), app.Echo()))", "1"},
        {"print(#{app:Echo(unpack({}, 1, 0))}, select('#', app:Echo(unpack({}, 1, 100))))",
         "0\t100"},
        {"print(app:EchoTable(1, 'x')[2])", "x"},
        {"for _, k in ipairs{{}, print, true, 'a\\0', '\\255'} do print(try(function() "
         "return app[k] end) == 'Unsupported key type!') end",
         "true\ntrue\ntrue\ntrue\ntrue"},
        {"print(pcall(function() app[{}] = 1 end))",
         "false\t[string \"t\"]:1: Unsupported key type!"},
        {"print(tostring(app):match('^Board %(0x%x+%) %[App: .near. on 0.0.0.0') ~= nil)", "true"},
    };
    Check(cases);
}

TEST_P(LuaObjectTest, ErrorsOfCommands) {
    const Case cases[] = {
        {"print(app.LastError, app:Fail(), app.LastError, app.LastError)", "nil\tnil\ttold\tnil"},
        {"app.LastError = 5 app:Fail() app:Echo() print(app.LastError)", "told"},
        {"print(app.Broken, app.LastError)", "nil\tno such name"},
        {"print(app <= app:Make(), app.LastError)", "false\tUnknown Symbol."},
        // Names that the globals do not know are only tried, and leave what is pending.
        {"orv.using(app) print(Speed, Echo(7), Broken, app.LastError)", "1\t7\tnil\tnil"},
        {"app:Fail() print(Broken, app.LastError) orv.using()", "nil\ttold"},
        // Arguments that cannot be sent, and results that cannot be taken.
        {"print(try(app.Echo, app, {{io.stdout}}))", "Unsupported type for custom data!"},
        {"print(pcall(function() app.Speed = coroutine.create(print) end))",
         "false\t[string \"t\"]:1: Unsupported type for custom data!"},
        {"print(try(app, require('ffi').new('int')))", "Unsupported type for custom data!"},
        {"t = {} for i = 1, 300 do t = {t} end print(try(app.Echo, app, app:Make(), t))",
         "Table nested too deeply."},
        {"print(try(app.Echo, app, {['\\255'] = 1}))", "Unsupported type for custom data!"},
        {"t = {} for i = 1, 7000 do t[i] = {} end "
         "print(try(app.Echo, app, unpack(t)):match('^stack overflow'))",
         "stack overflow"},
    };
    Check(cases);
}

TEST_P(LuaObjectTest, SharedTablesDoNotExplode) {
    Set("KORVEL_MaxPacketSize", "1");
    const Case cases[] = {
        {"t = {} for i = 1, 60 do t = {t, t} end print(try(app.Echo, app, t))",
         "Table nested too deeply."},
        {"t = {('x'):rep(300000)} print(#app:Echo(t)[1])", "300000"},
        {"print(try(app.Echo, app, {t, t, t, t}))", "Table nested too deeply."},
        {"print(app:Echo(('x'):rep(2^20)), app.LastError)", "nil\tPacket too large."},
    };
    Check(cases);
    Set("KORVEL_MaxPacketSize", "256");
}

TEST_P(LuaObjectTest, Values) {
    const Case cases[] = {
        {"b = app:Echo('a\\0b') print(b.Size, b[1], b[2], b[3])", "3\t97\t0\t98"},
        {"print(app:Kinds(1, 'x', 'a\\0', '\\255', {}, app, nil, print))",
         "1;x;block;block;table;local;nil;nil;"},
        {"t = app:Echo{3, 1, x = {__ctor = 'P', __flags = 256, 2}} "
         "print(t[1], t[2], t.x[1], t.x.__ctor, t.x.__flags)",
         "3\t1\t2\tP\t256"},
        {"o = app:Echo(app) print(o == app, rawequal(o, app), app:Echo{app}[1] == app)",
         "true\ttrue\ttrue"},
        {R"(_initffi()
            t = table.ordered()
            t.z = 1 t.a = 2 t[2] = 3 t[1] = 4
            t.z = nil t.b = 5 t.z = 6
            for k, v in _orderedtable_next, t do print(k, v) end
            for k, v in _orderedtable_next, app:Echo(t) do print(k, v) end)",
         "z\t6\na\t2\n2\t3\n1\t4\nb\t5\n__flags\t2097152\n1\t4\n2\t3\nz\t6\na\t2\nb\t5"},
        {"table.ordered = nil print(app:Echo(t).z)", "6"},
    };
    Check(cases);
}

// Functions travel as code, which runs where it arrives, unless it came from another process.
TEST_P(LuaObjectTest, Code) {
    const char* script =
        "count = 0 function f() count = count + 1 return count, 'second' end "
        "print(app:Kinds(f), app:Echo{f, 0}[1], app:Echo(f, 0), count, app:Echo(f, 0))";
    const char* isRun = "code;\t1\t2\t2\t3\t0";
    EXPECT_EQ(Run(script), IsJoined() ? isRun : "code;\tnil\tnil\t0\tnil\t0");
    Set("KORVEL_AllowRemoteCode", "true");
    EXPECT_EQ(Run(script), isRun);
    Set("KORVEL_AllowRemoteCode", "false");

    ScriptVal code;
    Run("function two() return 1, 2 end function none() end function bad() error('bad', 0) end");
    auto pushed = [&](const char* name) {
        s_State->GetGlobal(name, code);
        EXPECT_TRUE(code.IsCode());
        s_State->SetGlobal("v", code);
        return Run("print(v)");
    };
    EXPECT_EQ(pushed("two"), "1");
    EXPECT_EQ(pushed("none"), "nil");
    EXPECT_EQ(pushed("bad"), "nil");
}

TEST_P(LuaObjectTest, TheApplicationObject) {
    const Case cases[] = {
        {"print(app:SetTimeout(5), app:GetTimeout(), app:GetTimeout(7), app:SetTimeout('x'))",
         "0\t5\t5\t7"},
        {"print(app:SetTimeout(0/0), app:SetTimeout(-1), app:GetTimeout())", "7\t0\t0"},
        {"d = app:GetAppData() print(d.Name, d.Address, d.ID)", "near\t\t"},
        {"app:SetAppFlags(5) app:ClearAppFlags(1) app:SetAppFlags('8') app:ClearAppFlags() "
         "print(app:GetAppFlags(15), app:GetAppFlags('x'))",
         "4\tnil"},
        {R"(o = app:Make()
            for _, name in ipairs{'SetTimeout', 'GetTimeout', 'IsAppConnected', 'GetAppData',
                                  'SetAppFlags', 'ClearAppFlags', 'GetAppFlags'} do
                print(try(o[name], o, 1))
            end)",
         "Can only set timeout on application object.\n"
         "Can only set timeout on application object.\n"
         "Can only check connection on application object.\n"
         "Can only get data on application object.\n"
         "Can only set flags on application object.\n"
         "Can only clear flags on application object.\n"
         "Can only get flags on application object."},
        {"c = class._ScriptObject print(select('#', c(app, 0, 0, 1, 1), c(nil, 1), c({}, 1)))",
         "2"},
        {"print(c(app, 1, 2), c(app, 1, 2, 3, 4), c(app, 'x', 1, {}, 5), c(app, 0/0, 1, -1, 2^40))",
         "nil\tnil\tnil\tnil"},
        {"print(c(app, 5), select('#', c(app)))", "nil\t0"},
        {"f = app.Echo debug.setupvalue(f, 1, newproxy()) print(select('#', f(app, 1)))", "0"},
        {"echo = app.Echo print(app:IsAppConnected())", "true"},
    };
    Check(cases);
    Run("_thisapp = app");
    s_State->SetGlobalObject("found", s_Root);
    EXPECT_EQ(Run("print(found == app, rawequal(found, app))"), "true\ttrue");
    MakeLocal(s_Root);
    EXPECT_EQ(Run("app:SetTimeout(3) print(here:GetTimeout(), here:GetAppData().Name)"), "3\tnear");

    m_Near->_Disconnect(0xffffffff);
    EXPECT_EQ(Run("print(app:IsAppConnected(), select('#', echo(app, 1)), app.Speed, -app)"),
              "false\t0\tnil\tnil");
    EXPECT_EQ(Run("app.Speed = 1 print(app == o, app.LastError)"), "false\tnil");
    EXPECT_EQ(Run("print(tostring(app):match('^_ScriptObject <0x%x+>$') ~= nil)"), "true");
}

// The state knows the connection of its application: it traces it, tells it its data, and asks it
// for the objects that the host sets.
TEST_P(LuaObjectTest, TheApplicationOfAState) {
    Run("function ThisApp() return app end");
    s_State->SetThisApp("host.app", nullptr);
    EXPECT_NE(s_Printed.find("attempt to index global 'host'"), std::string::npos);
    s_State->SetThisApp("host", "h");
    EXPECT_EQ(Run("print(host == app, h == app)"), "true\ttrue");
    s_State->SetGlobal("root", ScriptVal(s_Root));
    EXPECT_EQ(Run("print(rawequal(root, app))"), "true");
    {
        Board gone;
        s_State->SetGlobalObject("o", &gone);
        EXPECT_EQ(Run("print(o:Echo(7))"), "7");
    }
    EXPECT_EQ(Run("print(o.Speed, app.LastError) o = nil"), "nil\tInvalid RemoteObject.");

    testing::internal::CaptureStdout();
    s_State->SetFlags(KorvelScript::STF_Trace);
    EXPECT_EQ(m_Near->GetFlags(), KorvelScript::STF_Trace);
    s_State->ClearFlags(KorvelScript::STF_Trace);
    EXPECT_EQ(m_Near->GetFlags(), 0u);
    testing::internal::GetCapturedStdout();
}

// An object of this process that comes back is called without the connection.
TEST_P(LuaObjectTest, ObjectsOfTheOwnProcess) {
    auto* board = new Board;
    MakeLocal(board);
    const Case cases[] = {
        {"print(here:Echo(1, nil), here(2), here + 3, here.Speed)",
         "1\tSST_Call 1=2\tSST_Add 1=3\t1"},
        {"here.Speed = 9 print(here.Speed, app.Speed)", "9\t1"},
        {"print(app:Kinds(here), here:Kinds(here, app))",
         IsJoined() ? "remote and local;\tlocal;remote;" : "remote;\tlocal;remote;"},
        {"print(app:Echo(here) == here, rawequal(app:Echo{here}[1], here))", "true\ttrue"},
        {"app:Keep(here) print(rawequal(app:Kept(), here)) app:Keep()", "true"},
        {"here:Fail() print(here.LastError, app.LastError)", "told\tnil"},
        {"print(here <= app, app.LastError)", "false\tUnknown Symbol."},
        {"print(try(here.GetTimeout, here))", "Can only set timeout on application object."},
        {"print(tostring(here):match('^Board %(0x%x+%)$') ~= nil)", "true"},
        {"echo = here.Echo print(here:RunHere('x = 5 print(x)'), x)", "5\n0\t5"},
        {"print(try(here.Throw, here))", "thrown"},
    };
    Check(cases);
    // It is counted by the userdata alone, and not reached when it has gone all the same.
    Run("collectgarbage() collectgarbage()");
    delete board;
    EXPECT_EQ(Run("print(echo(here, 1), here.Speed, app.LastError, app:Kinds(here))"),
              "nil\tnil\tInvalid RemoteObject.\tnil;");
}

TEST_P(LuaObjectTest, ProxiesStayOnTheirConnection) {
    auto* near = new RemoteApp("other near", 0, nullptr);
    auto* far = new RemoteApp("other far", 0, nullptr);
    ASSERT_TRUE(RemoteApp::Join(near, far));
    s_State->SetGlobal("other", near->FindRemoteObject(1));
    EXPECT_EQ(Run("print(app:Kinds(other, {other}, app), other:Kinds(app, other), app == other)"),
              "nil;table;local;\tnil;local;\tfalse");
    EXPECT_EQ(Run("other:Fail() print(app.LastError, other.LastError)"), "nil\ttold");
    // An object of the own process has one userdata for each connection, and keeps it.
    Run("holders = {app:Make(), other:Make()}");
    auto* board = new Board;
    for (int i : {1, 2}) {
        ScriptVal holder;
        s_State->GetGlobal("holders", holder);
        holder[i].CallMember("Keep", board);
    }
    board->DecRef();
    EXPECT_EQ(Run("a, b = holders[1]:Kept(), holders[2]:Kept()"
                  " print(rawequal(a, holders[1]:Kept()), rawequal(b, holders[2]:Kept()), a == b)"),
              "true\ttrue\ttrue");
    EndState();
    for (RemoteApp* end : {near, far}) {
        end->_Disconnect(0xffffffff);
        Release(end);
    }
}

// What a host pushes itself.
TEST_P(LuaObjectTest, RecordsOfConnections) {
    lua_State* L = luaL_newstate();
    s_LuaType_RemoteObject.lw_register(L);
    auto* board = new Board;
    RemoteObject* record = m_Near->_IncLocalRef(board);
    ASSERT_NE(record, nullptr);
    board->DecRef();
    _PushScriptObject(L, record, true);
    lua_setglobal(L, "kept");
    _PushScriptObject(L, record, false);
    lua_setglobal(L, "given");
    _PushScriptObject(L, nullptr, false);
    lua_setglobal(L, "none");
    const char* script =
        "return (given == kept and 'same ' or '') .. kept:Echo(5) .. kept:Kinds(given) ..\n"
        "    (none and '?' or 'nil')";
    EXPECT_EQ(lua_gettop(L), 0);
    EXPECT_EQ(luaL_dostring(L, script), 0);
    EXPECT_STREQ(lua_tostring(L, -1), "same 5local;nil");
    lua_close(L);
}

// A script lets go of what a command is about, in the middle of it.
TEST_P(LuaObjectTest, UserdataThatIsReleased) {
    const Case cases[] = {
        {"gc = getmetatable(app).__gc o = app:Make() f = o.Echo gc(o) gc(o) "
         "print(o.Speed, f(o), -o, try(app.Echo, app, o))",
         "nil\tnil\tnil\tUnsupported type for custom data!"},
        {"_orderedtable_meta = {} _orderedtable_next = function(t, k) gc(o) end "
         "o = app:Make() print(o:Kinds(setmetatable({}, _orderedtable_meta)), o.Speed)",
         "table;\tnil"},
    };
    Check(cases);
}

// Whichever allocation of a command fails, Lua's or ours: no count is lost.
TEST_P(LuaObjectTest, FailingAllocations) {
    auto allocate = [](void*, void* old, size_t oldSize, size_t size) -> void* {
        if (size == 0) return free(old), nullptr;
        if (size > oldSize) return realloc(old, size);
        Faults::Uncounted shrinking;
        return realloc(old, size);
    };
    auto run = [](lua_State* L) {
        auto** objects = static_cast<ScriptVal**>(lua_touserdata(L, 1));
        ToLua(s_App, L, *objects[0], nullptr, nullptr, 0);
        objects[1]->ToRemoteObject()->IncRef();
        _PushScriptObject(L, objects[1]->ToRemoteObject(), false);
        lua_getglobal(L, "run");
        lua_insert(L, -3);
        lua_call(L, 2, 0);
        return 0;
    };
    const char* script =
        "function run(here, app) local made = here:Make() made.Speed = 'x'\n"
        "here:Echo({app, made}, run, 'text', app) here:Fail() return here.LastError end";
    auto* board = new Board;
    ScriptVal here(board);
    board->DecRef();
    ScriptVal app = m_Near->FindRemoteObject(1);
    ScriptVal* objects[] = {&here, &app};
    s_App = m_Near;
    uint32_t count = app.ToRemoteObject()->m_Count;
    unsigned n = 0;
    for (bool hasFailed = true; hasFailed;) {
        lua_State* L = lua_newstate(allocate, nullptr);
        s_LuaType_RemoteObject.lw_register(L);
        ASSERT_EQ(luaL_dostring(L, script), 0);
        Faults::FailAt(++n, false);
        int error = lua_cpcall(L, run, objects);
        hasFailed = Faults::Stop() >= n;
        EXPECT_TRUE(hasFailed || !error) << "an error without a failure";
        lua_close(L);
    }
    EXPECT_EQ(app.ToRemoteObject()->m_Count, count);
    EXPECT_GT(n, 60u);
}

INSTANTIATE_TEST_SUITE_P(Roads, LuaObjectTest, testing::Values(false, true),
                         [](const auto& form) { return form.param ? "Joined" : "Socket"; });

}  // namespace
}  // namespace Korvel

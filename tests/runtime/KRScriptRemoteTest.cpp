// What the host library offers scripts to reach other processes, with a script server of the
// test's own.
#include <gtest/gtest.h>

#include <lua.hpp>
#include <string>

#include "Platform/Event.h"
#include "Support.h"
#include "core/RefObject.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptPort.h"
#include "runtime/lua/KRScriptLib.h"

namespace Korvel {
namespace {

using Test::ServerTool;

constexpr unsigned int kLimitMs = 60000;

class Listening : public Scripted<RefObject> {
    KORVEL_SCRIPTED(Listening)
public:
    Listening() { SetScriptClass(); }

    KorvelScript::Event m_HasHeard;
    std::string m_Heard;
};

KORVEL_PUBLISH(Listening, "Listening", "Keeps what it is told.", "")
KORVEL_FUNCTION(Listening, Hear, SSF_AnyThread) {
    self.m_Heard = args[1].IsLocalObject(false) ? "object" : "other";
    for (int i = 2; i <= 4; i++) self.m_Heard += ' ' + std::string(args[i].ToString("other"));
    self.m_HasHeard.Signal();
}
KORVEL_PUBLISHED(Listening);

class KRScriptRemote : public testing::Test {
protected:
    KRScriptRemote() {
        EXPECT_EQ(lua_cpcall(
                      m_Lua, [](lua_State* L) { return OpenAllLibs(L), 0; }, nullptr),
                  0);
    }
    ~KRScriptRemote() override {
        CloseInterpreter(m_Lua);
        CleanupScripting();
        g_ScriptConfig = nullptr;
    }

    void Start(uint32_t flags) {
        s_App = m_App.Get();
        m_Config.m_Flags = flags | SCF_Standard;
        m_Config.m_AppName = "Hearer";
        m_Config.GetApp = [](void*, TagList*) { return s_App; };
        g_ScriptConfig = nullptr;
        _InitScripting(m_Config);
        ScriptVal info(SV_Table, nullptr);
        info["Priorities"] = SV_Table;
        info["Priorities"]["loud"] = 1;
        ASSERT_TRUE(StartScripting(info));
    }

    std::string Run(const std::string& text) {
        lua_settop(m_Lua, 0);
        if (luaL_loadbuffer(m_Lua, text.data(), text.size(), "=test") == 0) {
            lua_pcall(m_Lua, 0, 1, 0);
        }
        const char* result = lua_tostring(m_Lua, -1);
        return result ? result : "";
    }
    void Check(const std::string& condition) {
        EXPECT_EQ(Run("return tostring(not not (" + condition + "))"), "true") << condition;
    }

    ServerTool m_Tool{OXSCRIPT};
    static inline ScriptObject* s_App;
    ScriptConfig m_Config;
    ptr<Listening> m_App{new Listening};
    lua_State* m_Lua = luaL_newstate();
};

TEST_F(KRScriptRemote, KnowsThisProcess) {
    g_ScriptConfig = nullptr;
    Check("select('#', orv.getappname()) == 0 and ThisApp() == nil");
    Check("#orv.getappuuid() == 36 and GetAppUUID() == orv.getappuuid()");
    Check("#orv.createuuid() == 36 and CreateUUID() ~= CreateUUID()");
    Check("ScriptApp == orv.scriptapp and AsyncScriptApp == orv.asyncscriptapp");
    Check("SendNotify == orv.sendnotify and StartServer == orv.startserver");
    Check("pinghosts == orv.pinghosts and GetAppName == orv.getappname");
    Start(0);
    Check("orv.getappname() == 'Hearer'");
}

// Nobody is there: each call takes its defaults, and comes to nothing soon.
TEST_F(KRScriptRemote, TakesAnyArguments) {
    Start(0);
    Check("orv.scriptapp() == nil and select('#', orv.scriptapp()) == 1");
    Check("orv.scriptapp({}, 5, 'x', print, true, 'more') == nil");
    Check("orv.scriptapp('Nobody', nil, 0.5, 'no UUID', 'no subtype') == nil");
    Check("orv.scriptapp('\\255x', '127.0.0.1\\0x', 0/0) == nil");
    Check("orv.scriptapp(('x'):rep(1e6), '127.0.0.1', -1) == nil");
    Check("Korvel() == nil and Torvane('127.0.0.1', 1) == nil and ThisApp(1) == nil");
    Check("#orv.pinghosts(nil, 0.01, '127.0.0.1') == 0");
    Check("#orv.pinghosts({}, 0, '127.0.0.1') == 0 and #orv.pinghosts('\\255', -1, '127.1') == 0");
    Check("select('#', orv.sendnotify()) == 0 and select('#', orv.sendnotify(5, 'x', {})) == 0");
    Check(
        "select('#', orv.sendnotify({1, {}, 'x'}, 'Hear')) == 0 and not pcall(orv.sendnotify, "
        "{io.stdout}, 'x')");
    Check("not pcall(orv.sendnotify, {}, coroutine.create(print))");
}

TEST_F(KRScriptRemote, FindsHostsByName) {
    Start(SCF_Host);
    Check("orv.scriptapp('Hearer').ClassName == 'Listening'");
    Check("orv.scriptapp('!Hearer', '127.0.0.1', 10, GetAppUUID(), 'loud') ~= nil");
    Check("orv.scriptapp('Hearer', nil, 10, CreateUUID()) == nil");
    Check("orv.scriptapp('Hearer', nil, 10, nil, 'quiet') == nil");
    Check("ThisApp(10):GetAppData().Name == 'Hearer' and ThisApp():GetTimeout() == 0");
    Check("orv.scriptapp('Hearer', nil, 7):GetTimeout() == 7");
    Check("orv.scriptapp().ClassName == 'ScriptServer'");
    Check("orv.scriptapp():GetHostList()[1].Name == 'Hearer'");
    Check("orv.pinghosts('', 0.2, '127.0.0.1')[1].Hosts[1] == 'Hearer'");
    Check("orv.pinghosts('Hearer', 0.2, '127.0.0.1')[1].Type == 'Hearer'");
    Run("app = orv.asyncscriptapp('Hearer', nil, 10)");
    Check("type(app) == 'userdata'");
    Run("local stop = orv.gettime() + 60 repeat until app.ClassName == 'Listening' or "
        "orv.gettime() > "
        "stop");
    Check("app:IsAppConnected() and orv.asyncscriptapp('Nobody').ClassName == nil");
}

TEST_F(KRScriptRemote, NotifiesWithoutWaiting) {
    Start(SCF_Host);
    Run("app = orv.scriptapp('Hearer')");
    const char* targets[] = {"app", "{app}", "{5, x = {}, other = app}"};
    for (const std::string target : targets) {
        EXPECT_EQ(Run("orv.sendnotify(" + target + ", 'Hear', app, 'a', nil, 'b')"), "");
        ASSERT_TRUE(m_App->m_HasHeard.Wait(kLimitMs)) << target;
        EXPECT_EQ(m_App->m_Heard, "object a other b") << target;
    }
}

}  // namespace
}  // namespace Korvel

// The command line tool finds hosts: real servers, hosts and scripts, with a script server of each
// test's own.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <string>

#include "Platform/Event.h"
#include "Support.h"
#include "core/RefObject.h"
#include "core/TagList.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "remote/ScriptPort.h"
#include "runtime/ScriptLanguage.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;
using KorvelScript::ScriptLanguage;

constexpr unsigned int kLimitMs = 60000;

bool Contains(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

// With one blank between the columns.
std::string Squeeze(std::string text) {
    auto areBlank = [](char a, char b) { return a == ' ' && b == ' '; };
    text.erase(std::unique(text.begin(), text.end(), areBlank), text.end());
    return text;
}

std::string ServerPort(unsigned int port) {
    return "KORVEL_ScriptServerPort=" + std::to_string(port);
}

// On the host of a name; what the text prints, or what the tool has to say.
std::string RunOn(const char* name, const char* text) {
    ProcessResult result = RunProcess({OXSCRIPT, "--host", name, "-e", text});
    return result.m_Out + result.m_Err;
}

class Hosts : public testing::Test {
protected:
    ServerTool m_Tool{OXSCRIPT};
};
using StartedScripts = Hosts;

TEST_F(Hosts, AreListed) {
    ProcessResult none = RunProcess({OXSCRIPT, "--hosts"}, {ServerPort(FreePort())});
    EXPECT_EQ(none.m_Status, 0);
    EXPECT_EQ(none.m_Out, "");
    EXPECT_TRUE(Contains(none.m_Err, "no script server answers")) << none.m_Err;
    none = RunProcess({OXSCRIPT, "--hosts", "--json"}, {ServerPort(FreePort())});
    EXPECT_EQ(none.m_Out, "[]\n");

    HostProcess first(MEDIAHOST), second(MEDIAHOST);
    ProcessResult list = RunProcess({OXSCRIPT, "--hosts"});
    EXPECT_EQ(list.m_Err, "");
    std::string rows = Squeeze(list.m_Out);
    EXPECT_TRUE(rows.starts_with("NAME PROCESS PORT USER MACHINE\nMediaHost ")) << list.m_Out;
    for (const HostProcess* host : {&first, &second}) {
        EXPECT_TRUE(Contains(rows, " " + std::to_string(host->GetPort()) + " ")) << list.m_Out;
    }
    EXPECT_EQ(std::count(list.m_Out.begin(), list.m_Out.end(), '\n'), 3) << list.m_Out;

    ProcessResult json = RunProcess({OXSCRIPT, "--hosts", "--json"});
    for (const char* field : {"Name", "ProcessID", "Port", "UserName", "HostName", "IP"}) {
        EXPECT_TRUE(Contains(json.m_Out, '"' + std::string(field) + '"')) << json.m_Out;
    }
    EXPECT_TRUE(Contains(json.m_Out, std::to_string(second.GetPort()))) << json.m_Out;
    EXPECT_EQ(json.m_Out[0], '[');

    // A name may hold anything; neither form shows what is no character.
    ProcessResult odd =
        RunProcess({OXSCRIPT, "-e",
                    "s = orv.scriptapp() s:AddHost { Name = 'b\\195d\\27[' } "
                    "os.execute('" OXSCRIPT " --hosts; " OXSCRIPT " --hosts --json')"});
    EXPECT_TRUE(Contains(odd.m_Out, "b?d?[")) << odd.m_Out;
    EXPECT_TRUE(Contains(odd.m_Out, "\"b?d?[\"")) << odd.m_Out;
}

TEST_F(Hosts, AreFoundByName) {
    HostProcess host(MEDIAHOST);
    EXPECT_EQ(RunOn("MediaHost", "print(app.ClassName)"), "MediaHost\n");
    EXPECT_EQ(RunOn("", "print(app.ClassName)"), "ScriptServer\n");
    EXPECT_EQ(RunOn("MediaHost", "print(startup, app:GetPingInfo().Title)"), "nil\tUntitled\n");

    ProcessResult unknown = RunProcess({OXSCRIPT, "--host", "No\33body", "-e", "print(1)"});
    EXPECT_EQ(unknown.m_Status, 255);
    EXPECT_EQ(unknown.m_Out, "");
    EXPECT_TRUE(Contains(unknown.m_Err, "no host 'No?body'; on this machine there is 'MediaHost'"))
        << unknown.m_Err;
    EXPECT_TRUE(Contains(RunOn("\xff", ""), "no host '?'"));
    ProcessResult alone =
        RunProcess({OXSCRIPT, "--host", "MediaHost", "-e", ""}, {ServerPort(FreePort())});
    EXPECT_EQ(alone.m_Status, 255);
    EXPECT_TRUE(Contains(alone.m_Err, "no script server runs on this machine")) << alone.m_Err;
    EXPECT_TRUE(Contains(alone.m_Err, "Start the host")) << alone.m_Err;
}

// Where nobody listens at 127.0.0.1.
TEST_F(Hosts, AreFoundAtTheirAddress) {
    setenv("KORVEL_ListenAddress", "127.0.0.2", 1);
    HostProcess host(MEDIAHOST);
    EXPECT_EQ(RunOn("MediaHost", "print(app.ClassName)"), "MediaHost\n");
    std::string port = std::to_string(host.GetPort());
    EXPECT_EQ(RunProcess({OXSCRIPT, "-a", port, "-e", "print(app.Title)"}).m_Out, "Untitled\n");
    EXPECT_TRUE(Contains(RunProcess({OXSCRIPT, "--hosts"}).m_Out, port));
    unsetenv("KORVEL_ListenAddress");
}

TEST_F(Hosts, RefusesOptionsThatDoNotFitTogether) {
    const std::vector<std::string> cases[] = {
        {"--json"},        {"--hosts", "x.lua"}, {"--host", "x", "-a", "1"},
        {"-s", "--hosts"}, {"-s", "x.lua"},      {"--hosts", "--host", "x"},
        {"--host"},
    };
    for (std::vector<std::string> args : cases) {
        args.insert(args.begin(), OXSCRIPT);
        ProcessResult result = RunProcess(args);
        EXPECT_EQ(result.m_Status, 2) << args[1];
        EXPECT_TRUE(result.m_Out.empty() && Contains(result.m_Err, "Usage:")) << result.m_Err;
    }
    EXPECT_EQ(RunProcess({MEDIAHOST, "--priority"}).m_Status, 2);
    EXPECT_EQ(RunProcess({MEDIAHOST, "--priority", "1x"}).m_Status, 2);
}

// A host that starts scripts in processes of their own.
class Starter : public Scripted<RefObject> {
    KORVEL_SCRIPTED(Starter)
public:
    Starter() { SetScriptClass(); }

    KorvelScript::Event m_HasTold;
    std::string m_Told;
};

KORVEL_PUBLISH(Starter, "Starter", "", "")
KORVEL_FUNCTION(Starter, Tell, SSF_AnyThread) {
    self.m_Told = args[1].ToString("nothing");
    self.m_HasTold.Signal();
}
KORVEL_PUBLISHED(Starter);

TEST_F(StartedScripts, GetWhatHasBeenKeptForThem) {
    static ScriptConfig s_Config;
    static ptr<Starter> s_App(new Starter);
    s_Config.m_Flags = SCF_Host | SCF_Standard;
    s_Config.m_AppName = "Starter";
    s_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_App.Get(); };
    _InitScripting(s_Config);
    ASSERT_TRUE(StartScripting(ScriptVal()));
    KorvelScript::InitLanguages(TagList());

    TempDir dir;
    std::string file = dir.Write("two words.lua",
                                 "local s = startup app:Tell(s and s.word .. s.StateData.n .. "
                                 "tostring(s.UUID) or 'no data')");
    ScriptVal data(SV_Table, nullptr);
    data["word"] = "good";
    data["StateData"] = SV_Table;
    data["StateData"]["n"] = 7;
    ScriptLanguage* lua = KorvelScript::g_LuaScriptLanguage;
    ASSERT_EQ(lua->ExecuteFileExternal(file.c_str(), data), 0);
    ASSERT_TRUE(s_App->m_HasTold.Wait(kLimitMs));
    EXPECT_EQ(s_App->m_Told, "good7nil");
    ASSERT_EQ(lua->ExecuteFileExternal(file.c_str(), ScriptVal()), 0);
    ASSERT_TRUE(s_App->m_HasTold.Wait(kLimitMs));
    EXPECT_EQ(s_App->m_Told, "no data");
    EXPECT_EQ(lua->ExecuteFileExternal((dir.Path("a\"b.lua")).c_str(), data), 1);
    CleanupScripting();
    KorvelScript::CleanupLanguages();
}

}  // namespace
}  // namespace Korvel

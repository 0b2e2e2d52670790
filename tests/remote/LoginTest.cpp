// What peers may do that have not logged in.
#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <utility>

#include "RemoteFixture.h"
#include "objects/ScriptSymbol.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPortInternal.h"
#include "remote/ScriptServer.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;

class Vault : public Scripted<_Object> {
    KORVEL_SCRIPTED(Vault)
public:
    Vault() { SetScriptClass(); }
    ScriptVal m_Kept;
};
KORVEL_PUBLISH(Vault, "Vault", "", "")
KORVEL_FUNCTION(Vault, Open, SSF_AnyThread) {
    args.ReturnString("open");
}
KORVEL_FUNCTION(Vault, Keep, SSF_AnyThread) {
    self.m_Kept = args[1];
}
KORVEL_FUNCTION(Vault, GetPingInfo, SSF_AnyThread) {
    args.ReturnString("closed");
}
KORVEL_PUBLISHED(Vault);

class Login : public testing::Test {
protected:
    Login() {
        s_Vault = &m_Vault;
        s_NumAsked = 0;
        m_Config.m_AppName = "Vault";
        m_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_Vault; };
        m_Config.Login = [](void*, RemoteApp*, const char* user, const char* password, TagList*) {
            s_NumAsked++;
            return std::string(user) == "user" && std::string(password) == "password";
        };
        g_ScriptConfig = &m_Config;
        PublishHostMembers(*m_Vault.GetScriptInfo());
    }
    ~Login() override {
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
        WithdrawHostMembers();
        g_ScriptConfig = nullptr;
    }

    static ScriptVal Call(Bare& peer, uint32_t opcode, const ScriptVal& key = {},
                          const ScriptVal& first = {}, const ScriptVal& second = {}) {
        ScriptArgs args;
        args.SetArguments(first, second);
        args.SetPosition(0, key);
        return peer.Ask(PKT_Script, opcode, 1, args);
    }
    static ScriptVal CallMember(Bare& peer, const char* name, const ScriptVal& first = {},
                                const ScriptVal& second = {}) {
        return Call(peer, SST_CallMemberFunction, name, first, second);
    }
    static bool IsRefused(const ScriptVal& results) {
        return results["Error"] == static_cast<double>(SCERR_NotLoggedIn);
    }

    static inline ScriptObject* s_Vault;
    static inline int s_NumAsked;
    ScriptConfig m_Config;
    Vault m_Vault;
};

TEST_F(Login, IsAllThatStrangersCanDo) {
    Bare peer;
    auto expectAllRefused = [&] {
        for (uint32_t opcode = 1; opcode <= SST_EndOpcode; opcode++) {
            EXPECT_TRUE(IsRefused(Call(peer, opcode))) << opcode;
            bool isByName = opcode == SST_GetTable || opcode == SST_CallMemberFunction;
            EXPECT_TRUE(isByName || IsRefused(Call(peer, opcode, "__Login"))) << opcode;
        }
        for (const char* name : {"Open", "help", "__LoginTable", "__login", "_", "FindSymbol"}) {
            EXPECT_TRUE(IsRefused(CallMember(peer, name))) << name;
            EXPECT_TRUE(IsRefused(Call(peer, SST_GetTable, name))) << name;
        }
        auto open = reinterpret_cast<uint64_t>(m_Vault.GetScriptInfo()->FindSymbol("Open", 0));
        for (uint64_t address : {open, uint64_t{0}, open + 8}) {
            ScriptVal function;
            function.Set(SV_Function, &address);
            EXPECT_TRUE(IsRefused(Call(peer, SST_CallFunction, function)));
            EXPECT_TRUE(IsRefused(Call(peer, SST_CallMemberFunction, function)));
        }
        for (uint32_t target : {0u, 2u, UINT32_MAX}) {
            EXPECT_TRUE(IsRefused(peer.Ask(PKT_Script, SST_CallMemberFunction, target)));
        }
        EXPECT_TRUE(IsRefused(peer.Ask(PKT_Script, SST_GetTable, 1, "no arguments")));
        auto address = reinterpret_cast<uintptr_t>(&m_Vault);
        for (uint32_t type : {PKT_GetObjectInfo, PKT_LocalToRemote, PKT_SetStateData}) {
            EXPECT_TRUE(IsRefused(peer.Ask(type, static_cast<uint32_t>(address),
                                           type == PKT_LocalToRemote ? address >> 32 : 1)))
                << type;
        }
        // Counts are not asked for.
        EXPECT_TRUE(peer.Ask(PKT_IncRef, 0, 1).IsNil() && peer.Ask(PKT_DecRef, 0, 1).IsNil());
    };
    for (int run = 0; run < 2; run++) {
        SCOPED_TRACE(run);
        s_NumAsked = 0;
        expectAllRefused();
        EXPECT_TRUE(CallMember(peer, "__Connect", "stranger", "uuid")[-1].IsTable());
        EXPECT_STREQ(peer.m_App->GetName(), "stranger");
        EXPECT_TRUE(CallMember(peer, "__Login")[-1] == false);
        EXPECT_TRUE(CallMember(peer, "__Login", "user", "Password")[-1] == false);
        EXPECT_TRUE(CallMember(peer, "__Login", 5, m_Config.m_AppName)[-1] == false);
        expectAllRefused();
        EXPECT_FALSE(peer.m_App->IsLoggedIn());
        // As scripts do: the function first.
        ScriptVal login = Call(peer, SST_GetTable, "__Login")[-1];
        ASSERT_TRUE(login.IsFunction());
        EXPECT_TRUE(Call(peer, SST_CallFunction, login, "user", "password")[-1] == true);
        EXPECT_EQ(s_NumAsked, 4);
        EXPECT_TRUE(CallMember(peer, "Open")[-1] == "open");
        EXPECT_TRUE(peer.Ask(PKT_GetObjectInfo, 0, 1).IsTable());
        EXPECT_TRUE(CallMember(peer, "__Login", "user", "wrong")[-1] == true) << "it is in";
        EXPECT_EQ(s_NumAsked, 4);
        peer.Reconnect();  // as another one
    }
}

TEST_F(Login, IsAskedForWhereTheHostWantsIt) {
    m_Config.m_Version = 1;  // whose record ends before the callback
    {
        Bare peer;
        EXPECT_TRUE(CallMember(peer, "Open")[-1] == "open");
        EXPECT_TRUE(CallMember(peer, "__Login", "user", "wrong")[-1] == true);
    }
    m_Config.m_Version = 2;
    Link inProcess(true);
    EXPECT_TRUE(inProcess.m_Far->FindRemoteObject(1).CallMember("Open") == "open");
    EXPECT_EQ(s_NumAsked, 0);
}

// Two ends of which one has called the other: the names are those of who sits there.
class CallerAndCalled : public Login {
protected:
    CallerAndCalled() { m_Caller->SetTimeOut(kLimitMs / 1000); }
    ~CallerAndCalled() override {
        m_Vault.m_Kept = SV_Nil;
        m_Caller->_Disconnect(kLimitMs);
        m_Called->_Disconnect(kLimitMs);
    }

    template <class Call>
    void Connect(Call&& call) {
        std::thread accept([&] { EXPECT_TRUE(m_Called->Connect(m_Listener.Accept())); });
        EXPECT_TRUE(call());
        accept.join();
    }

    Vault m_Gift;
    Listener m_Listener;
    ptr<RemoteApp> m_Called{new RemoteApp("called", 0, nullptr)};
    ptr<RemoteApp> m_Caller{new RemoteApp("caller", 0, nullptr)};
};

// A host that was found by name may be anybody's.
TEST_F(CallerAndCalled, CanUseWhatItHasBeenGiven) {
    ScriptVal reply, host = m_Caller->FindRemoteObject(1);
    Connect([&] { return m_Caller->Connect(kLoopback, m_Listener.m_Port, reply); });
    ScriptVal caller = m_Called->FindRemoteObject(1);
    EXPECT_TRUE(caller.CallMember("Open").IsNil() && caller.CallMember("GetPingInfo").IsNil());
    EXPECT_EQ(m_Called->LocalToRemote(reinterpret_cast<uintptr_t>(&m_Vault)), nullptr);
    EXPECT_TRUE(host.CallMember("Open").IsNil());
    EXPECT_TRUE(host.CallMember("__Login", "user", "password") == true);
    host.CallMember("Keep", static_cast<ScriptObject*>(&m_Gift));
    ASSERT_TRUE(m_Vault.m_Kept.IsRemoteObject());
    EXPECT_TRUE(m_Vault.m_Kept.CallMember("Open") == "open");
    EXPECT_TRUE(caller.CallMember("Open").IsNil()) << "which it has not been given";
    m_Caller->SetLoggedIn(m_Caller->GetRun());  // the host trusts it
    EXPECT_TRUE(caller.CallMember("Open") == "open");
    EXPECT_EQ(s_NumAsked, 1);
}

// Whoever reaches the script server can have it call all hosts.
TEST_F(CallerAndCalled, IsAScriptServerThatMayAskForLittle) {
    const unsigned int oldPort = std::exchange(g_ScriptServerPort, m_Listener.m_Port);
    ScriptVal server = AsyncScriptApp("", nullptr, ScriptVal(), "127.0.0.1", 60, false);
    m_Caller = ptr<RemoteApp>::Share(server.GetApp());
    Connect([&] { return m_Caller->Connect(); });
    ScriptVal host = m_Called->FindRemoteObject(1);
    EXPECT_TRUE(host.CallMember("GetPingInfo") == "closed");
    EXPECT_TRUE(host.CallMember("GetPingInfo", 1).IsNil());
    EXPECT_TRUE(host.CallMember("GetPingInfo", ScriptVal(), 1).IsNil());
    EXPECT_TRUE(host.CallMember("Open").IsNil());
    EXPECT_EQ(m_Called->LocalToRemote(reinterpret_cast<uintptr_t>(&m_Vault)), nullptr);
    EXPECT_TRUE(host.CallMember("__Login", "user", "password") == true);
    EXPECT_TRUE(host.CallMember("Open") == "open");
    g_ScriptServerPort = oldPort;
}

}  // namespace
}  // namespace Korvel

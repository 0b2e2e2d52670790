// Connections at work, over a socket and within the process.
#include "remote/RemoteApp.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <thread>
#include <vector>

#include "Platform/Event.h"
#include "Platform/Networking.h"
#include "Platform/Time.h"
#include "Support.h"
#include "core/RefObject.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "remote/Packets.h"

namespace Korvel {
namespace {

constexpr unsigned int kLimitMs = 60000;

// An object that is served. It lives as long as somebody counts it.
class Box : public Scripted<_Object> {
    KORVEL_SCRIPTED(Box)
public:
    Box() {
        SetScriptClass();
        s_NumAlive++;
    }
    ~Box() override { s_NumAlive--; }
    void IncRef() override { m_Count++; }
    void DecRef() override {
        if (--m_Count == 0) delete this;
    }

    static inline std::atomic<int> s_NumAlive{0};
    static inline KorvelScript::Event s_Entered;
    static inline KorvelScript::Event s_Gate;
    static inline ScriptArgs* s_Deferred = nullptr;

private:
    std::atomic<int> m_Count{1};
};

KORVEL_PUBLISH(Box, "Box", "Answers.", "")
KORVEL_OPCODE(Box, SST_Call, SSF_AnyThread) {
    args.Return(args[1]);
}
KORVEL_OPCODE(Box, SST_Add, SSF_AnyThread) {
    Box* made = new Box;
    args.ReturnObject(made);
    made->DecRef();
}
KORVEL_OPCODE(Box, SST_Sub, SSF_AnyThread) {
    Box::s_Entered.Signal();
    Box::s_Gate.Wait(kLimitMs);
    args.ReturnNumber(1);
}
KORVEL_OPCODE(Box, SST_Concat, SSF_AnyThread) {
    Box::s_Deferred = args.DeferReply();
    Box::s_Entered.Signal();
}
KORVEL_OPCODE(Box, SST_Div, SSF_AnyThread) {
    args.SetError(SCERR_InvalidArgs, "told");
}
KORVEL_PUBLISHED(Box);

constexpr unsigned int kLoopback = 0x0100007F;  // 127.0.0.1 in network order

// Listens on a port of the system's choice.
class Listener {
public:
    Listener() {
        using namespace Platform;
        EXPECT_TRUE(BindSocket(m_Socket, 0, kLoopback) && ListenSocket(m_Socket, 0));
        _SocketAddress* address = GetSocketAddress(m_Socket);
        m_Port = SocketAddressGetPort(address);
        DeleteSocketAddress(address);
    }
    ~Listener() { Platform::DeleteSocket(m_Socket); }
    Platform::_Socket* Accept() { return Platform::AcceptSocket(m_Socket); }

    Platform::_Socket* const m_Socket = Platform::NewSocket(Platform::ST_TCP);
    unsigned int m_Port;
};

// The two ends of a TCP connection of this machine.
struct Ends {
    Ends() {
        Listener listener;
        m_Near = Platform::NewSocket(Platform::ST_TCP);
        EXPECT_TRUE(Platform::ConnectSocket(m_Near, listener.m_Port, kLoopback));
        m_Far = listener.Accept();
    }
    Platform::_Socket* m_Near;
    Platform::_Socket* m_Far;
};

class RemoteAppTest : public testing::TestWithParam<bool> {
protected:
    RemoteAppTest() {
        s_Root = new Box;
        m_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_Root; };
        g_ScriptConfig = &m_Config;
        m_Near = new RemoteApp("near", 0, nullptr);
        m_Far = new RemoteApp("far", 0, nullptr);
        if (GetParam()) {
            EXPECT_TRUE(RemoteApp::Join(m_Near, m_Far));
        } else {
            Ends ends;
            EXPECT_TRUE(m_Near->Connect(ends.m_Near) && m_Far->Connect(ends.m_Far));
        }
        m_Near->SetTimeOut(60);
        m_Proxy = m_Near->FindRemoteObject(1);
    }
    ~RemoteAppTest() override {
        m_Proxy = SV_Nil;
        for (RemoteApp* app : {m_Near, m_Far}) app->_Disconnect(0xffffffff);
        for (RemoteApp* app : {m_Near, m_Far}) {
            while (app->Connected()) std::this_thread::yield();
            app->Recycle();
        }
        s_Root->DecRef();
        for (int i = 0; Box::s_NumAlive && i < 5000; i++) Platform::Wait(1);
        EXPECT_EQ(Box::s_NumAlive, 0);
        g_ScriptConfig = nullptr;
    }

    ScriptVal Call(int op, const ScriptVal& value) {
        ScriptArgs args;
        args.SetArguments(value);
        ScriptVal result;
        m_HasReply = m_Proxy.ToRemoteObject()->DoCommand(op, args, result);
        return result;
    }

    static inline Box* s_Root;
    ScriptConfig m_Config;
    RemoteApp* m_Near;
    RemoteApp* m_Far;
    ScriptVal m_Proxy;
    bool m_HasReply = false;
};

TEST_P(RemoteAppTest, CarriesValuesThereAndBack) {
    std::vector<char> bytes(3 << 20);
    for (size_t i = 0; i < bytes.size(); i++) bytes[i] = static_cast<char>(i * 7 >> 3);
    ScriptVal table(SV_Table, nullptr);
    for (int i = 1; i < 1000; i++) table[i] = "some text";
    table["inner"] = table;
    const ScriptVal values[] = {ScriptVal(),
                                5,
                                "text",
                                true,
                                table,
                                MemBlock(bytes.data(), static_cast<uint32_t>(bytes.size())),
                                MemBlock(bytes.data(), 65536 - 60)};
    for (const ScriptVal& value : values) {
        ScriptVal result = Call(SST_Call, value);
        EXPECT_TRUE(m_HasReply);
        EXPECT_TRUE(result[-1] == value);
    }
    EXPECT_TRUE(Call(SST_Div, 1)["ErrorString"] == "told");
    EXPECT_TRUE(Call(SST_Mul, 1)["Error"] == static_cast<int>(SCERR_UnknownSymbol));
    OxStringT<char> text;
    EXPECT_EQ(m_Near->TakeLastError(text), static_cast<uint32_t>(SCERR_UnknownSymbol));
    EXPECT_EQ(m_Near->TakeLastError(text), 0u);
}

TEST_P(RemoteAppTest, ServesManyThreadsAtOnce) {
    std::vector<std::thread> threads;
    std::atomic<int> numRight{0};
    for (int thread = 0; thread < 8; thread++) {
        threads.emplace_back([&, thread] {
            for (int i = 0; i < 500; i++) {
                ScriptArgs args;
                args.SetArguments(thread * 1000 + i);
                ScriptVal result;
                m_Proxy.ToRemoteObject()->DoCommand(SST_Call, args, result);
                numRight += result[-1] == thread * 1000 + i;
            }
        });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(numRight, 4000);
}

TEST_P(RemoteAppTest, GivesUpInTime) {
    m_Near->SetTimeOut(0.05);
    Call(SST_Sub, 1);
    EXPECT_FALSE(m_HasReply);
    ASSERT_TRUE(Box::s_Entered.Wait(kLimitMs));

    static std::atomic<int> numCalled;
    static KorvelScript::Event called;
    numCalled = 0;
    auto callback = [](void*, RemoteApp*, Packet* reply, unsigned int) {
        EXPECT_EQ(reply, nullptr);
        numCalled++;
        called.Signal();
        return false;
    };
    ScriptArgs args;
    EXPECT_NE(m_Proxy.ToRemoteObject()->DoCommandAsync(SST_Call, args, callback, nullptr), 0u);
    EXPECT_TRUE(called.Wait(kLimitMs));
    Box::s_Gate.Signal();  // now the late replies come
    m_Near->SetTimeOut(60);
    EXPECT_TRUE(Call(SST_Call, 7)[-1] == 7);
    EXPECT_EQ(numCalled, 1);
    EXPECT_EQ(m_Near->WaitPkt(1, 0), nullptr);
    EXPECT_EQ(m_Near->PollPkt(12345), nullptr);
}

TEST_P(RemoteAppTest, ReleasesItsWaitersWhenItEnds) {
    std::thread waiter([&] { Call(SST_Sub, 1); });
    ASSERT_TRUE(Box::s_Entered.Wait(kLimitMs));
    std::thread end([&] { m_Near->_Disconnect(0xffffffff); });
    waiter.join();
    EXPECT_FALSE(m_HasReply);
    Box::s_Gate.Signal();
    end.join();
    EXPECT_FALSE(m_Near->Connected());
    Call(SST_Call, 1);
    EXPECT_FALSE(m_HasReply);
    Packet* packet = CreatePkt(PKT_DoNothing, m_Near, nullptr, nullptr);
    EXPECT_EQ(m_Near->DoPkt(packet), nullptr);
    EXPECT_EQ(m_Near->SendPkt(packet), 0u);
}

TEST_P(RemoteAppTest, EndsWhenNothingIsUnderWay) {
    ScriptArgs args;
    args.SetArguments("later");
    Packet* packet = ScriptVal::ToPacket(m_Proxy.ToRemoteObject(), SST_Concat, nullptr, &args);
    uint32_t context = m_Near->SendPkt(packet);
    ASSERT_TRUE(Box::s_Entered.Wait(kLimitMs));
    m_Near->Disconnect();
    EXPECT_EQ(m_Near->PollPkt(context), nullptr);
    EXPECT_TRUE(m_Near->Connected());
    Box::s_Deferred->ReturnString("at last");
    Box::s_Deferred->SendReply();
    delete Box::s_Deferred;
    Packet* reply = m_Near->WaitPkt(context, 60);
    ASSERT_NE(reply, nullptr);
    ScriptVal result;
    EXPECT_TRUE(ScriptVal::FromPacket(m_Near, reply, nullptr, &result));
    EXPECT_TRUE(result[-1] == "at last");
    FreePkt(reply);
    m_Near->Disconnect();
    while (m_Near->Connected()) std::this_thread::yield();
}

TEST_P(RemoteAppTest, CountsTheObjectsThatCross) {
    ScriptVal made = Call(SST_Add, 0)[-1];
    EXPECT_TRUE(made.IsRemoteObject());
    EXPECT_EQ(Box::s_NumAlive, 2);
    ScriptVal back = Call(SST_Call, made)[-1];
    EXPECT_TRUE(back == made);
    made = SV_Nil;
    ScriptArgs args;
    args.SetArguments(3);
    ScriptVal result;
    EXPECT_TRUE(back.ToRemoteObject()->DoCommand(SST_Call, args, result));
    EXPECT_TRUE(result[-1] == 3);
    back = SV_Nil;
    while (Box::s_NumAlive > 1) {
        EXPECT_TRUE(Call(SST_Call, 1)[-1] == 1);
        std::this_thread::yield();
    }
}

INSTANTIATE_TEST_SUITE_P(Forms, RemoteAppTest, testing::Bool(), [](const auto& form) {
    return std::string(form.param ? "InProcess" : "Socket");
});

// What a peer sends that is no packet ends its connection, and nothing else.
TEST(RemoteAppPeer, IsClosedForWhatIsNoPacket) {
    struct Case {
        uint32_t m_Size;
        uint32_t m_Type;
        uint32_t m_First;  // of the values
    };
    const Case cases[] = {{39, PKT_Script, 0},
                          {0, PKT_Script, 0},
                          {0xffffffff, PKT_Script, 0},
                          {40, PKT_SetStateData, SV_Number},
                          {40, PKT_GetObjectInfo, 99}};
    ScriptConfig config;
    g_ScriptConfig = &config;
    testing::internal::CaptureStderr();
    for (const Case& c : cases) {
        Ends ends;
        auto* app = new RemoteApp("victim", 0, ends.m_Far);
        uint32_t packet[10] = {c.m_Size, c.m_Type, 1, 1, 1, 0, 0, 0, 0, c.m_First};
        EXPECT_EQ(Platform::SocketSend(ends.m_Near, packet, sizeof(packet)), 40);
        char byte;
        EXPECT_EQ(Platform::SocketReceive(ends.m_Near, &byte, 1, nullptr, nullptr), 0);
        Platform::DeleteSocket(ends.m_Near);
        while (app->Connected()) std::this_thread::yield();
        app->Recycle();
    }
    EXPECT_NE(testing::internal::GetCapturedStderr(), "");
    g_ScriptConfig = nullptr;
}

// A peer that was written after the description of the protocol, in another process.
TEST(RemoteAppPeer, ServesAnIndependentPeer) {
    static Box* root;
    root = new Box;
    ScriptConfig config;
    config.GetApp = [](void*, TagList*) -> ScriptObject* { return root; };
    g_ScriptConfig = &config;
    Listener listener;
    RemoteApp* app = nullptr;
    std::thread accept([&] { app = new RemoteApp("peer", 0, listener.Accept()); });
    Korvel::Test::ProcessResult result = Korvel::Test::RunProcess(
        {"/usr/bin/python3", PEER_SCRIPT, std::to_string(listener.m_Port)});
    accept.join();
    EXPECT_EQ(result.m_Out + result.m_Err, "ok\n");
    while (app->Connected()) std::this_thread::yield();
    app->_Disconnect(0xffffffff);
    app->Recycle();
    root->DecRef();
    for (int i = 0; Box::s_NumAlive && i < 5000; i++) Platform::Wait(1);
    EXPECT_EQ(Box::s_NumAlive, 0);
    g_ScriptConfig = nullptr;
}

}  // namespace
}  // namespace Korvel

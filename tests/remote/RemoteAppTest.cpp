// Connections at work, over a socket and within the process.
#include "remote/RemoteApp.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <climits>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <thread>
#include <vector>

#include "RemoteFixture.h"
#include "Support.h"

namespace Korvel {
namespace {

using namespace Test;

class RemoteAppTest : public testing::TestWithParam<bool> {
protected:
    RemoteAppTest() {
        m_Near->SetTimeOut(kLimitMs / 1000);
        m_Proxy = m_Near->FindRemoteObject(1);
    }

    ScriptVal Call(int op, const ScriptVal& value) {
        ScriptArgs args;
        args.SetArguments(value);
        ScriptVal result;
        m_HasReply = m_Proxy.ToRemoteObject()->DoCommand(op, args, result);
        return result;
    }

    BoxHost m_Host;
    Link m_Link{GetParam()};
    RemoteApp* const m_Near = m_Link.m_Near;
    RemoteApp* const m_Far = m_Link.m_Far;
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

TEST_P(RemoteAppTest, AsyncRepliesComeAsPackets) {
    struct Answer {
        ScriptVal m_Result;
        KorvelScript::Event m_HasCome;
    } answer;
    auto take = [](void* data, RemoteApp* app, Packet* reply, unsigned int) {
        auto* to = static_cast<Answer*>(data);
        EXPECT_TRUE(reply && ScriptVal::FromPacket(app, reply, nullptr, &to->m_Result));
        FreePkt(reply);
        to->m_HasCome.Signal();
        return true;
    };
    ScriptArgs args;
    args.SetArguments("text");
    RemoteObject* root = m_Proxy.ToRemoteObject();
    EXPECT_NE(root->DoCommandAsync(SST_Call, args, take, &answer), 0u);
    ASSERT_TRUE(answer.m_HasCome.Wait(kLimitMs));
    EXPECT_TRUE(answer.m_Result[-1] == "text");
    EXPECT_NE(root->DoCommandAsync(SST_Call, args, nullptr, nullptr), 0u);

    // A reply that the callback leaves stays for whoever asks, without a wait.
    Setting noLook("KORVEL_PollMicroseconds", "0", "50");
    auto leave = [](void* data, RemoteApp*, Packet*, unsigned int) {
        static_cast<Answer*>(data)->m_HasCome.Signal();
        return false;
    };
    uint32_t context = root->DoCommandAsync(SST_Call, args, leave, &answer);
    ASSERT_TRUE(answer.m_HasCome.Wait(kLimitMs));
    Packet* reply = nullptr;
    EXPECT_TRUE(WaitUntil([&] { return (reply = m_Near->PollPkt(context)) != nullptr; }));
    FreePkt(reply);
    EXPECT_EQ(m_Near->PollPkt(context), nullptr);
}

// The callback hears of its request once, whatever becomes of the reply that it has left.
TEST_P(RemoteAppTest, AReplyThatWasLeftIsNotToldAgain) {
    struct Told {
        std::atomic<int> m_NumReplies{0};
        std::atomic<int> m_NumEnds{0};
    } told;
    auto leave = [](void* data, RemoteApp*, Packet* reply, unsigned int) {
        auto* to = static_cast<Told*>(data);
        (reply ? to->m_NumReplies : to->m_NumEnds)++;
        return false;
    };
    ScriptArgs args;
    RemoteObject* root = m_Proxy.ToRemoteObject();
    uint32_t context = 0;
    int numLate = 0;
    for (double seconds = 0.05; told.m_NumReplies == 0; seconds *= 2) {
        m_Near->SetTimeOut(seconds);
        context = root->DoCommandAsync(SST_Call, args, leave, &told);
        EXPECT_TRUE(WaitUntil([&] { return told.m_NumReplies || told.m_NumEnds > numLate; }));
        numLate = told.m_NumEnds;
    }
    // Its time has passed when that of a later one has.
    EXPECT_NE(root->DoCommandAsync(SST_Concat, args, leave, &told), 0u);
    EXPECT_TRUE(WaitUntil([&] { return told.m_NumEnds > numLate; }));
    ASSERT_TRUE(Box::s_Entered.Wait(kLimitMs));
    delete Box::s_Deferred;
    Packet* reply = m_Near->PollPkt(context);
    EXPECT_NE(reply, nullptr);
    FreePkt(reply);
    EXPECT_EQ(m_Near->PollPkt(context), nullptr);

    m_Near->SetTimeOut(kLimitMs / 1000);
    EXPECT_NE(root->DoCommandAsync(SST_Call, args, leave, &told), 0u);
    EXPECT_TRUE(WaitUntil([&] { return told.m_NumReplies == 2; }));
    m_Link.End();
    EXPECT_EQ(told.m_NumReplies, 2);
    EXPECT_EQ(told.m_NumEnds, numLate + 1);
}

TEST_P(RemoteAppTest, DelaysKeepTheOrder) {
    using Clock = std::chrono::steady_clock;
    auto start = Clock::now();
    std::vector<uint32_t> contexts;
    for (unsigned delayMs : {0, 60, 0, 60}) {
        Packet* packet = CreatePkt(PKT_IncRef, m_Near, nullptr, nullptr);
        packet->m_Delay = delayMs;
        contexts.push_back(m_Near->SendPkt(packet));
    }
    for (size_t i : {3u, 2u, 1u, 0u}) {
        Packet* reply = m_Near->WaitPkt(contexts[i], i == 3 ? kLimitMs / 1000 : -1);
        EXPECT_NE(reply, nullptr) << "the last one is answered last";
        FreePkt(reply);
    }
    EXPECT_GE(Clock::now() - start, std::chrono::milliseconds(120));
}

// Only members set the keys that make an error, or a delay, of a reply.
TEST_P(RemoteAppTest, ReservedKeysOfArgumentsAreTakenOut) {
    ScriptArgs args;
    args.SetArguments("text");
    args["Error"] = 9;
    args["ErrorString"] = "from the caller";
    args["__delay"] = 1e9;
    ScriptVal result;
    EXPECT_TRUE(m_Proxy.ToRemoteObject()->DoCommand(SST_Call, args, result));
    EXPECT_TRUE(result[-1] == "text");
    EXPECT_TRUE(result["Error"].IsNil() && result["ErrorString"].IsNil());
}

TEST_P(RemoteAppTest, TellsWhereAnObjectIs) {
    EXPECT_TRUE(Call(SST_ToString, 0)[-1] == "a box [App: 'near' on 0.0.0.0, UUID: <nil>]");
}

TEST_P(RemoteAppTest, NumbersObjectsByAddress) {
    Box* box = new Box;
    ScriptVal value(box);  // from now on scripts have seen it
    uint64_t address = reinterpret_cast<uintptr_t>(box);
    RemoteObject* proxy = m_Near->LocalToRemote(address);
    ASSERT_NE(proxy, nullptr);
    {
        ScriptArgs args;
        ScriptVal result;
        EXPECT_TRUE(proxy->DoCommand(SST_ToString, args, result));
        EXPECT_TRUE(result["Error"].IsNil());
    }
    EXPECT_EQ(m_Near->LocalToRemote(address), proxy);
    for (int i = 0; i < 2; i++) proxy->DecRef();
    value = SV_Nil;
    box->DecRef();
    EXPECT_TRUE(WaitUntil([] { return Box::s_NumAlive == 1; }));
    for (uint64_t hostile :
         {address, uint64_t{0}, uint64_t{1}, ~uint64_t{0}, reinterpret_cast<uint64_t>(m_Far)}) {
        EXPECT_EQ(m_Near->LocalToRemote(hostile), nullptr) << hostile;
    }
}

TEST_P(RemoteAppTest, ItsOwnThreadDoesNotWait) {
    EXPECT_TRUE(Call(SST_Pow, 0)[-1] == false);
}

TEST_P(RemoteAppTest, TracesWhatACallCauses) {
    testing::internal::CaptureStdout();
    m_Near->SetFlags(PKF_Trace);
    Call(SST_Call, "text");
    m_Near->ClearFlags(PKF_Trace);
    Call(SST_Call, "more");
    std::string out = testing::internal::GetCapturedStdout();
    char expected[1000];
    snprintf(expected, sizeof expected,
             "App %p: Send ctx=1 tgt=1 PKT_Script SST_Call \n"
             "App %p: Recv ctx=1 tgt=1 PKT_Script SST_Call \n"
             "   -> [1] { \"text\" }\n"
             "   <- [1] { [-1] = \"text\" }\n"
             "App %p: Send ctx=1 tgt=0 PKT_Reply \n"
             "App %p: Recv ctx=1 tgt=0 PKT_Reply \n",
             static_cast<void*>(m_Near), static_cast<void*>(m_Far), static_cast<void*>(m_Far),
             static_cast<void*>(m_Near));
    EXPECT_EQ(out, expected);
}

TEST_P(RemoteAppTest, ConnectsAgain) {
    ScriptVal made = Call(SST_Add, 0)[-1];
    ASSERT_TRUE(made.IsRemoteObject());
    for (int i = 0; i < 20; i++) {
        bool isOurs = i % 2 == 0;
        (isOurs ? m_Near : m_Far)->_Disconnect(i % 4 < 2 ? kLimitMs : 0);
        while (m_Near->Connected() || m_Far->Connected()) std::this_thread::yield();
        ScriptArgs args;
        ScriptVal result;
        EXPECT_FALSE(made.ToRemoteObject()->DoCommand(SST_Call, args, result));
        m_Proxy = SV_Nil;
        ASSERT_TRUE(m_Link.Connect());
        m_Proxy = m_Near->FindRemoteObject(1);
        ASSERT_TRUE(m_Proxy.IsRemoteObject()) << "the way in, from the beginning";
        EXPECT_TRUE(Call(SST_Call, i)[-1] == i);
        EXPECT_TRUE(made.ToRemoteObject()->DoCommand(SST_Call, args, result));
        EXPECT_TRUE(result["Error"] == 10) << "given on a connection that has ended";
    }
}

// The peer lets go of it as soon as it has answered, which must not overtake the answer.
TEST_P(RemoteAppTest, AnObjectComesHomeFromAPeerThatKeepsNothing) {
    for (int i = 0; i < 200; i++) {
        Box* box = new Box;
        ScriptVal own(box);
        box->DecRef();
        ASSERT_TRUE(Call(SST_Call, own)[-1] == own) << i;
    }
}

INSTANTIATE_TEST_SUITE_P(Forms, RemoteAppTest, testing::Bool(), [](const auto& form) {
    return std::string(form.param ? "InProcess" : "Socket");
});

// The thread of either connection of a pair brings what the other one waits for.
TEST(RemoteAppPair, TheOtherOnesThreadDoesNotWait) {
    BoxHost host;
    Link link(true);
    Box::s_Through = link.m_Near;
    link.m_Near->SetTimeOut(0);
    ScriptArgs args;
    ScriptVal result, root = link.m_Near->FindRemoteObject(1);
    EXPECT_TRUE(root.ToRemoteObject()->DoCommand(SST_Pow, args, result));
    EXPECT_TRUE(result[-1] == false);
    Box::s_Through = nullptr;
}

// The last peer comes to its end when the next one is there already.
TEST(RemoteAppPair, IsJoinedAnewAtOnce) {
    BoxHost host;
    ptr<RemoteApp> last(new RemoteApp("last", 0, nullptr)), next(new RemoteApp("next", 0, nullptr));
    ptr<RemoteApp> app(new RemoteApp("app", 0, nullptr));
    app->SetTimeOut(kLimitMs / 1000);
    for (int i = 0; i < 100; i++) {
        ASSERT_TRUE(RemoteApp::Join(last.Get(), app.Get()));
        EXPECT_TRUE(app->_Disconnect(kLimitMs));
        ASSERT_TRUE(RemoteApp::Join(app.Get(), next.Get()));
        EXPECT_TRUE(WaitUntil([&] { return last->GetUseCount() == 1; }));
        ScriptArgs args;
        ScriptVal result, root = app->FindRemoteObject(1);
        EXPECT_TRUE(root.ToRemoteObject()->DoCommand(SST_Call, args, result)) << i;
        for (RemoteApp* end : {app.Get(), next.Get()}) end->_Disconnect(kLimitMs);
    }
}

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
    BoxHost host;
    Bare other;
    for (const Case& c : cases) {
        Bare peer;
        uint32_t packet[10] = {c.m_Size, c.m_Type, 1, 1, 1, 0, 0, 0, 0, c.m_First};
        peer.Send(packet, sizeof packet);
        EXPECT_EQ(peer.Receive(), nullptr);
        EXPECT_TRUE(WaitUntil([&] { return !peer.m_App->Connected(); }));
    }
    EXPECT_TRUE(other.Ask(PKT_GetObjectInfo, 0, 1, 5)[1] == 5);
}

// In a process of its own, whose log goes to a folder of the test's own.
TEST(RemoteAppPeer, TellsTheLogWhyItIsClosed) {
    TempDir dir;
    std::string self = std::filesystem::read_symlink("/proc/self/exe");
    std::string command = "cd '" + dir.Path(".") + "' && exec '" + self +
                          "' --gtest_filter=RemoteAppPeer.IsClosedForWhatIsNoPacket";
    EXPECT_EQ(RunProcess({"sh", "-c", command}, {"OXSCRIPT_LOG_SERVER=true"}).m_Status, 0);
    std::string log;
    for (const auto& entry : std::filesystem::directory_iterator(dir.Path("."))) {
        std::ifstream file(entry.path());
        log.append(std::istreambuf_iterator<char>(file), {});
    }
    for (const char* why : {"of an impossible size", "with no valid values"}) {
        std::string line = "Connection to served closed: the peer sent a packet ";
        EXPECT_NE(log.find(line + why + ".\n"), std::string::npos) << log;
    }
}

// Only an opcode is a symbol: not a number above them, and none whose low bits are one's.
TEST(RemoteAppPeer, HasNoOtherSymbolsThanOpcodes) {
    BoxHost host;
    Bare peer;
    ScriptArgs args;
    for (uint32_t symbol :
         {154u, 155u, 255u, 0x100u | SST_Call, 0x182u, 0x18Fu, 0x80000000u | SST_Call, UINT_MAX}) {
        EXPECT_TRUE(peer.Ask(PKT_Script, symbol, 1, args)["Error"] == 9) << symbol;
    }
}

TEST(RemoteAppPeer, NumbersItsRequestsAsItLikes) {
    BoxHost host;
    Bare peer;
    for (uint32_t context : {0u, 7u, 7u, UINT_MAX}) {
        for (int op : {SST_Call, SST_Concat}) {
            if (op == SST_Concat && context == 0) continue;  // those are answered at once
            ScriptArgs args;
            args.SetArguments("text");
            Packet* packet = ScriptVal::ToPacket(nullptr, 1, op, nullptr, &args);
            packet->m_Context = context;
            peer.Send(packet);
            if (op == SST_Concat) {
                ASSERT_TRUE(Box::s_Entered.Wait(kLimitMs));
                ASSERT_NE(Box::s_Deferred, nullptr);
                Box::s_Deferred->ReturnString("text");
                EXPECT_TRUE(Box::s_Deferred->SendReply());
                delete Box::s_Deferred;
            }
            Packet* reply = peer.Receive();
            ASSERT_NE(reply, nullptr);
            EXPECT_TRUE(reply->m_Type == PKT_Reply && reply->m_Context == context);
            ScriptVal result;
            EXPECT_TRUE(ScriptVal::FromPacket(peer.m_App, reply, nullptr, &result));
            EXPECT_TRUE(result[-1] == "text");
            FreePkt(reply);
        }
    }
}

// Two peers may give the same number to objects of theirs.
TEST(RemoteAppPeer, WhatTheLastOneGaveLeadsToNobody) {
    BoxHost host;
    Bare peer;
    RemoteObject* old = peer.m_App->IncRemoteRef(7);
    peer.Reconnect();
    RemoteObject* fresh = peer.m_App->IncRemoteRef(7);
    auto expectNext = [&](uint32_t type, uint32_t target) {
        Packet* packet = peer.Receive();
        ASSERT_NE(packet, nullptr);
        EXPECT_TRUE(packet->m_Type == type && packet->m_Target == target) << packet->m_Target;
        FreePkt(packet);
    };
    for (RemoteObject* proxy : {old, fresh}) {
        ScriptArgs args;
        EXPECT_NE(proxy->DoCommandAsync(SST_Call, args, nullptr, nullptr), 0u);
        expectNext(PKT_Script, proxy == old ? UINT_MAX : 7);
    }
    old->DecRef();
    fresh->DecRef();
    expectNext(PKT_NoMoreRefs, 7);
}

// What this library serves, but does not ask for.
TEST(RemoteAppPeer, CountsAndTellsOnRequest) {
    BoxHost host;
    Bare peer;
    ScriptArgs args;
    ScriptVal made = peer.Ask(PKT_Script, SST_Add, 1, args)[-1];
    EXPECT_TRUE(made.IsNil()) << "nobody is there to count it";
    uint32_t id = 2;
    while (!RemoteApp::GetObjectPtr(id)) id++;
    EXPECT_TRUE(peer.Ask(PKT_GetObjectInfo, 0, id, "query")[1] == "query");
    EXPECT_TRUE(peer.Ask(PKT_GetObjectInfo, 0, id + 1).IsNil());
    for (uint32_t type : {PKT_IncRef, PKT_DecRef, PKT_DecRef}) {
        EXPECT_EQ(Box::s_NumAlive, 2);
        EXPECT_TRUE(peer.Ask(type, 0, id).IsNil());
    }
    EXPECT_TRUE(WaitUntil([] { return Box::s_NumAlive == 1; }));
    EXPECT_TRUE(peer.Ask(PKT_Script, SST_Call, id, args)["Error"] == 10);
    EXPECT_TRUE(peer.Ask(PKT_SetStateData, 0, 0, 5).IsNil());
    EXPECT_TRUE(peer.Ask(PKT_Script, 0, 1, args)["Error"] == 1);
    EXPECT_TRUE(peer.Ask(PKT_ScriptEvent, 0, 1)["Error"] == 5);
}

// A peer that was written after the description of the protocol, in another process.
TEST(RemoteAppPeer, ServesAnIndependentPeer) {
    BoxHost host;
    Listener listener;
    RemoteApp* app = nullptr;
    std::thread accept([&] {
        app = new RemoteApp("peer", 0, listener.Accept());
        app->SetTimeOut(kLimitMs / 1000);
        Box* box = new Box;
        ScriptVal own(box), result, root = app->FindRemoteObject(1);
        box->DecRef();
        uint64_t address = reinterpret_cast<uintptr_t>(box);
        ScriptArgs args;
        args.SetArguments(own, static_cast<uint32_t>(address), address >> 32);
        EXPECT_TRUE(root.ToRemoteObject()->DoCommand(SST_Call, args, result));
        EXPECT_TRUE(result[-1] == own);
        EXPECT_TRUE(result[-2].IsRemoteObject());
    });
    ProcessResult result =
        RunProcess({"/usr/bin/python3", PEER_SCRIPT, "objects", std::to_string(listener.m_Port)});
    accept.join();
    EXPECT_EQ(result.m_Out + result.m_Err, "ok\n");
    EXPECT_TRUE(WaitUntil([&] { return !app->Connected(); }));
    app->_Disconnect(kLimitMs);
    app->Recycle();
}

}  // namespace
}  // namespace Korvel

// The arguments and results of a call, and calls through proxies.
#include <gtest/gtest.h>

#include <memory>

#include "ScriptValFakes.h"
#include "core/ScriptVal.h"

namespace Korvel {
namespace {

using namespace Test;

TEST(ScriptArgs, ResultsCountDownFromMinusOne) {
    ScriptArgs args;
    char bytes[] = "abc";
    uint64_t place = 0;
    args[1] = "in";
    args.ReturnNumber(5);
    args.ReturnString("text");
    args.ReturnBoolean(true);
    args.ReturnNil();
    args.ReturnMemBlock(MemBlock(bytes, 3));
    args.ReturnCode(bytes, 2, 1);
    args.ReturnObject(nullptr);
    args.ReturnFunction(reinterpret_cast<ScriptSymbol*>(&place));
    args.Return(MakeTable());
    EXPECT_EQ(args[-8].ToFunction(), reinterpret_cast<uint64_t>(&place));
    args[-8] = SV_Nil;
    EXPECT_EQ(Describe(args),
              "a:{300001:-9=4:{} 300001:-8=0:nil 300001:-7=100000:nil 300001:-6=8:[ab] "
              "300001:-5=9:[abc] 300001:-4=0:nil 300001:-3=3:true 300001:-2=2:'text' "
              "300001:-1=1:5 1:1=2:'in'}");
    while (args.m_Value.m_Args.m_NumReturns != 255) args.Return();
    args.Return() = "wrapped";
    EXPECT_TRUE(args[0] == "wrapped" && args.m_Value.m_Args.m_NumReturns == 0);
}

TEST(ScriptArgs, CopiesCannotReply) {
    FakeWire wire;
    {
        ScriptArgs args;
        args[1] = 5;
        args.SetApp(wire.App(0));
        args.SetApp(wire.App(1));
        args.SetApp(wire.App(1));
        EXPECT_TRUE(wire.m_Uses[wire.App(0)] == 0 && wire.m_Uses[wire.App(1)] == 1);
        args.m_Value.m_Args.m_Context = 7;
        args.m_Flags |= SVF_FromWire;
        args.ReturnNumber(1);
        ScriptArgs copy(args);
        ScriptVal value(args);
        for (ScriptVal* v : {static_cast<ScriptVal*>(&copy), &value}) {
            EXPECT_TRUE(Describe(*v) == Describe(args) && !v->GetApp());
            EXPECT_TRUE(!v->m_Value.m_Args.m_Context && !v->m_Value.m_Args.m_NumReturns);
        }
        value = 5;
        value.SetApp(wire.App(2));
        EXPECT_FALSE(copy.DeferReply() || value.GetApp());
        copy.m_Flags |= SVF_ReadOnly;
        copy.SetApp(wire.App(2));
        EXPECT_FALSE(copy.GetApp() || copy.SetPosition(5, 5) || copy.SetArguments(1));
        ScriptVal moved(std::move(static_cast<ScriptVal&>(args)));
        EXPECT_TRUE(moved.GetApp() == wire.App(1) && args.m_Flags == 0);  // NOLINT: the rule
        args.Return() = 5;                                                // harmless
    }
    for (const auto& [app, uses] : wire.m_Uses) EXPECT_EQ(uses, 0);
}

TEST(ScriptArgs, GivesItsFirstResultAway) {
    ScriptArgs args;
    EXPECT_TRUE(args.TakeResult().IsNil());
    args.Return(MakeTable({{1, 2}}));
    args[-1].m_Flags |= SVF_ReadOnly;
    EXPECT_EQ(Describe(args.TakeResult()), "4:{300001:1=300001:2}");
    EXPECT_TRUE(args[-1].IsNil());
    {
        FakeObject object;
        args[-1] = &object;
    }
    EXPECT_EQ(Describe(args.TakeResult()), "100000:nil");  // a dead object's copy
}

TEST(ScriptArgs, DefersItsReply) {
    FakeWire wire;
    RemoteApp* app = wire.App(0);
    {
        ScriptArgs args;
        args[1] = 5;
        args.m_Value.m_Args.m_Context = 7;
        EXPECT_EQ(args.DeferReply(), nullptr);  // no connection
        args.SetApp(app);
        args.m_Value.m_Args.m_Context = 0;
        EXPECT_EQ(args.DeferReply(), nullptr);
        args.m_Value.m_Args.m_Context = 7;
        args.m_Flags |= SVF_CallDelay;
        args.ReturnNumber(1);
        std::unique_ptr<ScriptArgs> later(args.DeferReply());
        ASSERT_TRUE(later);
        EXPECT_EQ(args.DeferReply(), nullptr);  // once
        EXPECT_EQ(Describe(args), "a0000a:{}");
        EXPECT_EQ(Describe(*later), "80000a:{300001:-1=1:1 1:1=300001:5}");
        EXPECT_TRUE(later->m_Value.m_Args.m_Context == 7 && wire.m_Uses[app] == 2);
        later->ReturnString("more");
        EXPECT_TRUE(later->SendReply());
        EXPECT_TRUE(wire.m_Sent[-2] == "more" && wire.m_Sent[-1] == 1);
        wire.m_Answers = false;
        EXPECT_FALSE(later->SendReply());
    }
    EXPECT_EQ(wire.m_Uses[app], 0);
}

TEST(ScriptArgs, CallsGoThroughProxies) {
    FakeWire wire;
    FakeObject local;
    wire.m_Local = &local;
    wire.m_Reply.ReturnString("result");
    {
        ScriptVal proxy = wire.ProxyValue(0), near = wire.ProxyValue(1), number(5);
        EXPECT_TRUE(proxy.IsValidRemoteObject() && proxy.GetApp() == wire.App(0));
        ScriptObject* out = nullptr;
        EXPECT_TRUE(near.IsLocalObject(false) && near.ToLocalObject() == &local);
        EXPECT_TRUE(near.Get(SV_LocalObject, &out) && out == &local);
        EXPECT_FALSE(near.IsLocalObject(true) || proxy.IsLocalObject(false));
        EXPECT_EQ(proxy.ToLocalObject(&local), &local);
        auto sent = [&] { return std::to_string(wire.m_Opcode) + Shape(wire.m_Sent); };
        auto note = [&](const ScriptVal& result) {
            return (result == "result" ? "" : "?") + sent();
        };
        EXPECT_EQ(note(proxy.CallMember("Run")), "144{0='Run'}");
        EXPECT_EQ(note(proxy.CallMember("Run", 1, "b", true)), "144{0='Run' 1=1 2='b' 3=true}");
        EXPECT_EQ(note(proxy.DoAction("Play", MakeTable())), "144{0='DoAction' 1='Play' 2={}}");
        EXPECT_EQ(note(proxy.GetKey(2)), "130{0=2}");
        proxy.SetKey("key", "value");
        EXPECT_EQ(sent(), "131{0='key' 1='value'}");
        EXPECT_TRUE(proxy.QueueAction("Play", 5));
        EXPECT_EQ(sent(), "144{0='QueueAction' 1='Play' 2=5}");
        int called = 0;
        AsyncCallback callback = [](void* context, RemoteApp*, Packet*, unsigned int) {
            return ++*static_cast<int*>(context) > 0;
        };
        EXPECT_TRUE(proxy.AsyncCallMember(callback, &called, "Run", 1, 2, 3, 4, 5, 6, 7, 8));
        EXPECT_EQ(sent(), "144{0='Run' 1=1 2=2 3=3 4=4 5=5 6=6 7=7 8=8}");
        EXPECT_EQ(wire.m_Sent.m_Value.m_Args.m_Table->m_Next->m_Key.m_Flags, SV_Number | SVF_Int);
        EXPECT_FALSE(ScriptVal(&local).AsyncCallMember(callback, &called, "Run"));
        wire.m_Answers = false;
        EXPECT_FALSE(proxy.AsyncCallMember(callback, &called, "Run"));
        EXPECT_EQ(called, 1);
        for (ScriptVal* v : {&proxy, &number}) {
            EXPECT_TRUE(v->CallMember("Run").IsNil() && v->GetKey("a").IsNil());
        }
    }
    EXPECT_EQ(wire.m_Uses[wire.Proxy(0)], 0);
}

}  // namespace
}  // namespace Korvel

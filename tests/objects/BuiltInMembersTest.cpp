// What every object has from the root: index, calls, attributes.
#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "core/RefObject.h"
#include "objects/LiveSymbolsInternal.h"
#include "objects/ObjectReferences.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"

namespace {

using namespace Korvel;

class Clip : public Scripted<_Object> {
    KORVEL_SCRIPTED(Clip)
public:
    Clip() { SetScriptClass(); }

protected:
    double m_Level = 5;
    std::string m_Title = "clip";
};

KORVEL_PUBLISH(Clip, "AttrClip", "", "")
KORVEL_FUNCTION(Clip, Pair, SSF_AnyThread) {
    args.Return(args[1]);
    args.ReturnString(symbol->GetName());
}
KORVEL_FUNCTION(Clip, Later, SSF_Hidden) {
    args.m_Flags |= SVF_ReplyDeferred;
}
KORVEL_VARIABLE(Clip, Level, SSF_Read | SSF_Write | SSF_DelaySet, {SYMT_AttrName, "level"}) {
    if (set) {
        self.m_Level = args[1].ToNumber();
    } else {
        args.ReturnNumber(self.m_Level);
    }
}
KORVEL_VARIABLE(Clip, Title, SSF_Read, {SYMT_AttrName, "title"}) {
    if (set) self.m_Title = "overwritten";
    args.ReturnString(self.m_Title.c_str());
}
KORVEL_VARIABLE(Clip, Secret, SSF_Write, {SYMT_AttrName, "secret"}) {
    self.m_Title = args[1].ToString("");
}
KORVEL_VARIABLE(Clip, Trace, SSF_Read | SSF_Debug, {SYMT_AttrName, "trace"}) {
    args.ReturnBoolean(true);
}
KORVEL_CONSTANT(Clip, ClipMostLevel, 0) {
    args.ReturnNumber(11);
}
KORVEL_HELP(Clip, About);
KORVEL_CREATE(Clip, 0) {
    args.ReturnString("new clip");
}
KORVEL_PUBLISHED(Clip);

class Video : public Clip {
    KORVEL_SCRIPTED(Video)
public:
    Video() { SetScriptClass(); }
};

KORVEL_PUBLISH(Video, "AttrVideo", "", "")
KORVEL_VARIABLE(Video, OwnTitle, SSF_Read, {SYMT_AttrName, "title"}) {
    args.ReturnString("hidden by the base");
}
KORVEL_OPCODE(Video, SST_GetTableUnknown, 0) {
    if (args[0] == "Unlisted") args.ReturnNumber(1);
    if (args[0] == "Waits") args.m_Flags |= SVF_ReplyDeferred;
    if (args[0] == 7) args.ReturnString("seventh");
}
KORVEL_OPCODE(Video, SST_GetSetAttrs, 0) {
    if (set) {
        self.m_Level = args[1]["zoom"].ToNumber();
    } else if (args[2].IsNil() || args[2] == "zoom") {
        args[1]["zoom"] = 3;
    }
}
KORVEL_PUBLISHED(Video);

class Plain : public Scripted<_Object> {
    KORVEL_SCRIPTED(Plain)
public:
    Plain() { SetScriptClass(); }
};

KORVEL_PUBLISH(Plain, "AttrPlain", "", "")
KORVEL_PUBLISHED(Plain);

// Calls an opcode as a peer does, with the key and arguments 1 and up.
template <class... Values>
ScriptArgs Command(ScriptObject& object, unsigned opcode, const ScriptVal& key, Values... values) {
    ScriptArgs args;
    args.SetArguments(values...);
    args.SetPosition(0, key);
    object.GetScriptInfo()->FindSymbol(nullptr, opcode)->Call(&object, args, false);
    return args;
}

ScriptVal Index(ScriptObject& object, const ScriptVal& key) {
    return Command(object, SST_GetTable, key)[-1];
}

std::string Describe(const ScriptVal& value) {
    if (value.IsNumber()) return std::to_string(static_cast<int>(value.ToNumber()));
    if (!value.IsFunction()) return value.ToString("nil");
    auto* symbol = reinterpret_cast<ScriptSymbol*>(value.ToFunction());
    std::string text(symbol->GetName().IsEmpty() ? "create" : symbol->GetName());
    if (value.m_Flags & SVF_AnyThreadFunc) text += " anywhere";
    if (value.m_Flags & SVF_TableResult) text += " packed";
    return text;
}

TEST(BuiltInMembers, IndexFindsWhatANameMeans) {
    Clip clip;
    Video video;
    std::string longName(74, 'x'), tooLong(75, 'x');
    ScriptSymbolT<Clip> functions[2], hidesClass;
    functions[0].Init(1, longName.c_str(), SST_Function, __ScriptInfo_Clip, {});
    functions[1].Init(1, tooLong.c_str(), SST_Function, __ScriptInfo_Clip, {});
    hidesClass.Init(1, "AttrVideo", SST_Function, __ScriptInfo_Clip, {});
    const struct {
        ScriptObject* object;
        ScriptVal key;
        std::string found;
    } cases[] = {
        {&clip, "Pair", "Pair anywhere"},
        {&clip, "PairTable", "Pair anywhere packed"},
        {&clip, "Later", "Later"},  // hidden in the help alone
        {&clip, "Level", "5"},
        {&clip, "LevelTable", "nil"},  // functions alone
        {&clip, "Table", "nil"},
        {&clip, "pairTable", "nil"},
        {&clip, (longName + "Table").c_str(), longName + " packed"},
        {&clip, (tooLong + "Table").c_str(), "nil"},
        {&clip, tooLong.c_str(), tooLong},
        {&clip, "ClipMostLevel", "11"},
        {&clip, "About", "nil"},
        {&clip, "Trace", "nil"},  // not in debug mode
        {&clip, "Secret", "nil"},
        {&clip, "ClassName", "AttrClip"},
        {&clip, "GetHelp", "GetHelp"},
        {&clip, "AttrClip", "create"},
        {&clip, "AttrVideo", "AttrVideo"},  // the member goes first
        {&clip, "AttrPlain", "nil"},        // nothing creates one
        {&clip, "", "nil"},
        {&video, "Unlisted", "1"},
        {&video, 7, "seventh"},
        {&video, "AttrClip", "create"},  // only as nothing else has answered
        {&video, "LevelTable", "nil"},
    };
    for (const auto& c : cases) EXPECT_EQ(Describe(Index(*c.object, c.key)), c.found) << &c - cases;
    EXPECT_EQ(Command(video, SST_GetTable, "Waits").m_Value.m_Args.m_NumReturns, 0);
    for (const ScriptVal& key : {ScriptVal(7), ScriptVal(), ScriptVal(true)}) {
        EXPECT_TRUE(Command(clip, SST_GetTable, key)["Error"] == int{SCERR_InvalidIndex});
    }
}

TEST(BuiltInMembers, FunctionValuesAreCalledWhereTheyBelong) {
    Clip clip;
    Plain plain;
    ScriptVal pair = Index(clip, "Pair"), packed = Index(clip, "PairTable");
    ScriptArgs args = Command(clip, SST_CallFunction, pair, 5);
    EXPECT_TRUE(args[-1] == 5 && args[-2] == "Pair" && args["Error"].IsNil());
    args = Command(clip, SST_CallFunction, packed, 5);
    EXPECT_TRUE(args[-1][1] == 5 && args[-1][2] == "Pair" && args[-1].NumKeys() == 2);
    EXPECT_TRUE(args.FindKeyConst(-2).IsNil());
    args = Command(clip, SST_CallFunction, Index(clip, "LaterTable"));
    EXPECT_TRUE(args.FindKeyConst(-1).IsNil());

    uint64_t level = reinterpret_cast<uint64_t>(clip.GetScriptInfo()->FindSymbol("Level", 0));
    for (uint64_t address : {level, level + 8, uint64_t{0}, pair.ToFunction() + 1}) {
        args = Command(clip, SST_CallFunction, ScriptVal(SV_Function, &address));
        EXPECT_TRUE(args["Error"] == int{SCERR_UnknownSymbol});
    }
    args = Command(plain, SST_CallFunction, packed, 5);
    EXPECT_TRUE(args["Error"] == int{SCERR_UnknownSymbol} && args.FindKeyConst(-1).IsNil());
    EXPECT_TRUE(Command(plain, SST_CallFunction, Index(plain, "AttrClip"))[-1] == "new clip");
    EXPECT_EQ(Command(clip, SST_CallFunction, "Pair").NumKeys(), 1u) << "no function, no effect";

    // By name. What is no function has no results.
    EXPECT_TRUE(Command(clip, SST_CallMemberFunction, "Pair", 6)[-1] == 6);
    EXPECT_TRUE(Command(clip, SST_CallMemberFunction, "PairTable", 6)[-1][1] == 6);
    for (const char* name : {"Level", "NoSuch", "About"}) {
        args = Command(clip, SST_CallMemberFunction, name, 6);
        EXPECT_TRUE(args.FindKeyConst(-1).IsNil() && args.FindKeyConst("Error").IsNil()) << name;
    }
}

TEST(BuiltInMembers, WritesComparesAndPrints) {
    Clip clip;
    Video other;
    int writes = 0;  // until two come close enough to each other that the later has to wait
    while (!Command(clip, SST_SetTable, "Level", 9).Exists("__delay")) ASSERT_LT(writes++, 100);
    for (const ScriptVal& key :
         {ScriptVal("Title"), ScriptVal("Pair"), ScriptVal("No"), ScriptVal(5)}) {
        EXPECT_EQ(Command(clip, SST_SetTable, key, 1).NumKeys(), 2u);
    }
    EXPECT_TRUE(Index(clip, "Title") == "clip" && Index(clip, "Level") == 9);

    EXPECT_TRUE(Command(clip, SST_EQ, {}, ScriptVal(&clip))[-1] == true);
    EXPECT_TRUE(Command(clip, SST_EQ, {}, ScriptVal(&other))[-1] == false);
    EXPECT_TRUE(Command(clip, SST_EQ, {}, 5)[-1] == false);
    char text[64];
    snprintf(text, sizeof text, "AttrClip (0x%lx)", reinterpret_cast<unsigned long>(&clip));
    EXPECT_STREQ(Command(clip, SST_ToString, {})[-1].ToString(""), text);
}

TEST(BuiltInMembers, AnObjectIsFoundByAddressAndReference) {
    Clip clip;
    auto target = std::make_unique<Clip>();
    auto address = reinterpret_cast<uint64_t>(target.get());
    uint64_t ref = ObjectReferences::AddObjectReference(target.get());
    auto low = [](uint64_t n) { return static_cast<double>(n & UINT32_MAX); };
    auto high = [](uint64_t n) { return static_cast<double>(n >> 32); };
    auto find = [&](auto... halves) {
        return ScriptVal(Command(clip, SST_GetObject, {}, halves...)[-1]).ToLocalObject();
    };
    EXPECT_EQ(find(low(address), high(address), low(ref), high(ref)), target.get());
    EXPECT_EQ(find(low(address), high(address)), nullptr) << "never without the reference";
    EXPECT_EQ(find(low(address), high(address), low(ref)), nullptr);
    EXPECT_EQ(find(low(address), high(address), low(ref + 1), high(ref)), nullptr);
    EXPECT_EQ(find(low(address) + 16, high(address), low(ref), high(ref)), nullptr);
    for (double wrong : {std::nan(""), -1.0, -low(ref), 0x1p32 + low(ref), low(ref) + 0.5, 1e300}) {
        EXPECT_EQ(find(low(address), high(address), wrong, high(ref)), nullptr) << wrong;
    }
    target.reset();
    EXPECT_EQ(find(low(address), high(address), low(ref), high(ref)), nullptr);
}

TEST(BuiltInMembers, AttributesAreReadAndWritten) {
    Clip clip;
    Video video;
    ScriptVal all = video.Invoke("GetAttrs");
    EXPECT_EQ(all.NumKeys(), 3u);
    EXPECT_TRUE(all["level"] == 5 && all["zoom"] == 3);
    EXPECT_TRUE(all["title"] == "clip") << "a base overwrites";
    EXPECT_EQ(clip.Invoke("GetAttrs").NumKeys(), 2u);
    EXPECT_TRUE(clip.Invoke("GetAttrs", "level") == 5 && video.Invoke("GetAttrs", "zoom") == 3);
    for (const ScriptVal& name : {ScriptVal("none"), ScriptVal("secret"), ScriptVal(5)}) {
        EXPECT_TRUE(video.Invoke("GetAttrs", name).IsNil());
    }

    ScriptVal values(SV_Table, nullptr);
    values["title"] = "no";  // read only
    values["level"] = 7;
    values["none"] = 1;
    clip.Invoke("SetAttrs", values);
    EXPECT_TRUE(clip.InvokeGet("Level") == 7 && clip.InvokeGet("Title") == "clip");
    values["secret"] = "title";
    values["zoom"] = 2;
    video.Invoke("SetAttrs", values);
    EXPECT_TRUE(video.InvokeGet("Title") == "title");
    EXPECT_TRUE(video.InvokeGet("Level") == 2) << "the hook comes last";
    for (const ScriptVal& wrong : {ScriptVal(), ScriptVal("level"), ScriptVal(7)}) {
        clip.Invoke("SetAttrs", wrong);
    }
    EXPECT_TRUE(clip.InvokeGet("Level") == 7);
}

TEST(BuiltInMembers, TheApplicationIsTheConfigurations) {
    static Clip* s_App;
    Clip clip, app;
    EXPECT_TRUE(clip.Invoke("GetApp").IsNil());
    ScriptConfig config;
    g_ScriptConfig = &config;
    EXPECT_TRUE(clip.Invoke("GetApp").KeepMe()) << "a nil object";
    config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_App; };
    s_App = &app;
    EXPECT_EQ(clip.Invoke("GetApp").ToLocalObject(), &app);
    g_ScriptConfig = nullptr;
}

}  // namespace

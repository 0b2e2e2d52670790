// Publishing, look-up and calls, as a host sees them.
#include "objects/ScriptObject.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Platform/Threads.h"
#include "core/FaultsInternal.h"
#include "core/RefObject.h"
#include "core/ScriptHooksInternal.h"
#include "core/TagList.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"

namespace {

using namespace Korvel;

// Settings of the process, put back at the end of a test.
class Settings {
public:
    Settings() = default;
    Settings(const Settings&) = delete;
    Settings& operator=(const Settings&) = delete;
    ~Settings() {
        g_ScriptConfig = nullptr;
        g_NoGUI = true;
        SetGUIThread(m_GUIThread);
        g_ScriptHooks = m_Hooks;
    }

    ScriptConfig m_Config;

private:
    unsigned long long m_GUIThread = GetGUIThread();
    ScriptHooks m_Hooks = g_ScriptHooks;
};

// The abstract base of a family, a class of it, and one that has nothing of its own.

class Shape : public Scripted<_Object> {
    KORVEL_SCRIPTED(Shape)
public:
    Shape() { SetScriptClass(); }
    virtual void Grow(ScriptArgs& args, ScriptSymbol* symbol, bool set) = 0;

    double m_Size = 1;
    std::string m_Name = "shape";
};

KORVEL_PUBLISH(Shape, "AnyShape", "A shape.", "")
KORVEL_FUNCTION(Shape, Add, SSF_AnyThread, {SYMT_ShortHelp, "Adds numbers."}, {SYMT_Usage, "use"},
                {SYMT_Optional, true}, {SYMT_ArgType, "number"}, {SYMT_Optional, false}) {
    double sum = self.m_Size;
    for (int i = 1; i <= 8; i++) sum += args[i].ToNumber();
    args.ReturnNumber(sum);
    args.ReturnString(symbol->GetName());
}
KORVEL_VARIABLE(Shape, Size, SSF_Read | SSF_Write, {SYMT_AttrName, "size"}) {
    if (set) {
        self.m_Size = args[1].ToNumber();
    } else {
        args.ReturnNumber(self.m_Size);
    }
}
KORVEL_VARIABLE(Shape, Name, SSF_Read) {
    if (set) self.m_Name = "overwritten";
    args.ReturnString(self.m_Name.c_str());
}
KORVEL_VARIABLE(Shape, Secret, SSF_Write) {
    if (set) self.m_Name = args[1].ToString("");
    args.ReturnString(self.m_Name.c_str());
}
KORVEL_FUNCTION(Shape, Trace, 0) {
    args.ReturnString("base");
}
KORVEL_OPCODE(Shape, SST_ToString, 0) {
    args.ReturnString("opcode");
}
KORVEL_FUNCTION(Shape, Fail, 0) {
    args.SetError(SCERR_InvalidArgs);
}
KORVEL_HELP(Shape, About, {SYMT_Body, "All about shapes."});
KORVEL_PUBLISHED(Shape);

class Circle : public Shape {
    KORVEL_SCRIPTED(Circle)
public:
    Circle() { SetScriptClass(); }
    void Grow(ScriptArgs& args, ScriptSymbol*, bool) override { args.ReturnString("circle"); }
};

KORVEL_PUBLISH(Circle, "Circle", "", "")
KORVEL_FUNCTION(Circle, Add, 0) {
    args.ReturnString("hidden");
}
KORVEL_FUNCTION(Circle, Trace, SSF_Debug) {
    args.ReturnString("traced");
}
KORVEL_PUBLISHED(Circle);

class Dot final : public Circle {
    KORVEL_SCRIPTED(Dot)
public:
    Dot() { SetScriptClass(); }
    void Grow(ScriptArgs& args, ScriptSymbol*, bool) override { args.ReturnString("dot"); }
};

KORVEL_PUBLISH(Dot, "Dot", "", "")
KORVEL_PUBLISHED(Dot);

// A class that serves calls by opcode as peers make them, and whose members pace their replies or
// tell where they run.
class Panel : public Scripted<_Object> {
    KORVEL_SCRIPTED(Panel)
public:
    Panel() { SetScriptClass(); }
};

KORVEL_PUBLISH(Panel, "Panel", "", "")
KORVEL_FUNCTION(Panel, Echo, 0) {
    args.ReturnString(args[1].ToString(""));
}
KORVEL_OPCODE(Panel, SST_GetTable, SSF_AnyThread) {
    ScriptSymbol* found = self.GetScriptInfo()->FindSymbol(args[0].ToString(nullptr), SST_Function);
    if (found) {
        args.ReturnFunction(found);
    } else {
        args.ReturnNumber(1);
    }
}
KORVEL_VARIABLE(Panel, Both, SSF_Read | SSF_Write | SSF_DelayGet | SSF_DelaySet) {}
KORVEL_VARIABLE(Panel, Reads, SSF_Read | SSF_Write | SSF_DelayGet) {}
KORVEL_FUNCTION(Panel, Exempt, SSF_DelayGet) {
    args.m_Flags &= ~SVF_CallDelay;
}
KORVEL_FUNCTION(Panel, Slow, 0) {
    args.m_Flags |= SVF_ForceDelay;
}
KORVEL_FUNCTION(Panel, OnUI, SSF_DelayGet) {
    args.ReturnBoolean(IsGUIThread());
}
KORVEL_FUNCTION(Panel, Anywhere, SSF_AnyThread) {
    args.ReturnBoolean(IsGUIThread());
}
KORVEL_PUBLISHED(Panel);

// Symbols by hand: a virtual member, and two of one name.
ScriptSymbolT<Shape> s_Grow(&Shape::Grow, "Grow", SST_Function, __ScriptInfo_Shape);
ScriptSymbolT<Shape> s_Twice(nullptr, "Twice", SST_Function, __ScriptInfo_Shape);
ScriptSymbolT<Shape> s_Nothing(nullptr, "Twice", SST_Variable | SSF_Read, __ScriptInfo_Shape);

std::string NameOf(const ScriptSymbol* symbol) {
    if (!symbol) return "none";
    const char* name = symbol->GetName();
    return std::string(symbol->GetInfo()->GetName()) + "." + (name ? name : "?");
}

TEST(ScriptInfo, FindsMembersUpTheChain) {
    struct Case {
        const ScriptInfo* info;
        const char* name;
        unsigned int kind;
        const char* found;
    };
    Dot dot;
    const ScriptInfo &shape = __ScriptInfo_Shape, &circle = __ScriptInfo_Circle;
    const ScriptInfo& info = *dot.GetScriptInfo();
    const Case cases[] = {
        {&circle, "Size", 0, "AnyShape.Size"},
        {&circle, "Add", 0, "Circle.Add"},  // the subclass hides it
        {&shape, "Add", 0, "AnyShape.Add"},
        {&info, "Add", SST_Function, "Circle.Add"},  // nothing of its own
        {&info, "Add", SST_Variable, "none"},        // of another kind
        {&info, "add", 0, "none"},                   // case counts
        {&info, "About", SST_Help, "AnyShape.About"},
        {&info, "", 0, "none"},
        {&info, nullptr, SST_Function, "none"},
        {&info, "ignored", SST_ToString, "AnyShape.?"},
        {&info, nullptr, SST_ToString + 256, "AnyShape.?"},  // modulo 256
        {&info, nullptr, SST_Concat, "none"},
        {&info, nullptr, 255, "none"},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(NameOf(c.info->FindSymbol(c.name, c.kind)), c.found) << &c - cases;
    }
    // Of two with one name the newer is found, unless its kind is not asked for.
    EXPECT_EQ(info.FindSymbol("Twice", 0), &s_Nothing);
    EXPECT_EQ(info.FindSymbol("Twice", SST_Function), &s_Twice);
    EXPECT_TRUE(info.GetParent() == &circle && shape.GetParent() == &GetRootScriptInfo());
    EXPECT_EQ(GetRootScriptInfo().GetParent(), nullptr);
    EXPECT_STREQ(GetRootScriptInfo().GetName(), "");
}

class Early : public Circle {
    KORVEL_SCRIPTED(Early)
public:
    Early() { SetScriptClass(); }
};

KORVEL_PUBLISH(Early, "Early", "", "")
KORVEL_FUNCTION(Early, First, 0) {}
KORVEL_CONSTANT(Early, LowLimit, SSF_AnyThread) {
    args.ReturnNumber(set ? -1 : 7);
}
KORVEL_FUNCTION(Early, Second, 0) {}
KORVEL_CONSTANT(Early, HighLimit, 0) {
    args.ReturnNumber(9);
}
KORVEL_PUBLISHED(Early);

std::string NamesFrom(SymbolRange::Iterator symbol) {
    std::string names;
    for (; symbol != SymbolRange::Iterator(); ++symbol)
        names += std::string(symbol->GetName()) + " ";
    return names;
}

TEST(ScriptInfo, FirstObjectFindsTheParentAndMovesConstants) {
    Dot unrelated;
    const ScriptInfo& info = __ScriptInfo_Early;
    EXPECT_FALSE(info.IsParentKnown());
    EXPECT_EQ(info.FindSymbol("Size", 0), nullptr);  // the class's own alone
    EXPECT_NE(info.FindSymbol("LowLimit", 0), nullptr);
    EXPECT_TRUE(unrelated.Invoke("LowLimit").IsNil());
    auto reader = info.GetSymbols().begin();  // stands on HighLimit while that moves
    {
        Early early;
        EXPECT_EQ(info.GetParent(), &__ScriptInfo_Circle);
        EXPECT_NE(info.FindSymbol("Size", 0), nullptr);
    }
    EXPECT_EQ(NamesFrom(reader).find("HighLimit Second "), 0u);  // went on where it was
    EXPECT_EQ(NamesFrom(info.GetSymbols().begin()), "Second First ");
    EXPECT_EQ(NamesFrom(GetRootScriptInfo().GetSymbols().begin()).find("HighLimit LowLimit "), 0u);
    EXPECT_TRUE(unrelated.InvokeGet("LowLimit").IsNil());  // no variable
    EXPECT_TRUE(unrelated.Invoke("LowLimit") == 7 && unrelated.Invoke("HighLimit") == 9);

    // A constant that comes later goes there at once, and goes away again.
    {
        ScriptSymbolT<Early> late(nullptr, "Late", SST_Constant, __ScriptInfo_Early);
        EXPECT_EQ(unrelated.GetScriptInfo()->FindSymbol("Late", SST_Constant), &late);
    }
    EXPECT_EQ(unrelated.GetScriptInfo()->FindSymbol("Late", 0), nullptr);
}

TEST(ScriptInfo, RunTimeClassesAreNamedTheirParent) {
    ScriptInfo* before = g_ScriptInfoList;
    {
        ScriptInfoT<Dot> first(1, "First", nullptr, nullptr);
        ScriptInfoT<Dot> second(1, "Second", "short", "long");
        EXPECT_TRUE(g_ScriptInfoList == &second && second.GetNext() == &first);
        EXPECT_STREQ(first.GetShortHelp(), "");
        EXPECT_STREQ(second.GetLongHelp(), "long");
        _InitScriptInfo(first, &first);  // no class is its own parent
        EXPECT_EQ(first.GetParent(), &GetRootScriptInfo());
        _InitScriptInfo(second, &first);
        _InitScriptInfo(second, nullptr);  // final
        EXPECT_EQ(second.GetParent(), &first);

        // The name is the symbol's own; initialised again, it leaves its former place.
        auto symbol = std::make_unique<ScriptSymbolT<Dot>>();
        std::string name = "Member";
        symbol->Init(1, name.c_str(), SST_Function, first, {});
        name = "Nobody";
        EXPECT_EQ(second.FindSymbol("Member", 0), symbol.get());
        symbol->Init(1, nullptr, SST_Call, second, {});
        EXPECT_EQ(first.FindSymbol("Member", 0), nullptr);
        ScriptSymbolT<Dot> other(nullptr, nullptr, SST_Call, second);
        symbol.reset();  // was replaced: the slot is not its own
        EXPECT_EQ(second.FindSymbol(nullptr, SST_Call), &other);
    }
    EXPECT_EQ(g_ScriptInfoList, before);
}

// Names of all lengths, and those that differ in one byte anywhere, or by a multiple of 256 bytes.
TEST(ScriptInfo, ComparesWholeNames) {
    ScriptInfoT<Dot> info(1, "Names", "", "");
    ScriptSymbolT<Dot> symbol;
    for (size_t length : {1u, 2u, 3u, 4u, 7u, 8u, 9u, 16u, 17u, 255u, 256u, 520u}) {
        std::string name(length, 'a');
        symbol.Init(1, name.c_str(), SST_Function, info, {});
        EXPECT_EQ(info.FindSymbol(name.c_str(), 0), &symbol) << length;
        for (size_t i = 0; i < length; i++) {
            std::string other = name;
            other[i] = 'b';
            EXPECT_EQ(info.FindSymbol(other.c_str(), 0), nullptr) << length << " at " << i;
        }
        for (size_t otherLength : {length + 1, length - 1, length + 256, length & 255}) {
            if (otherLength == length) continue;
            EXPECT_EQ(info.FindSymbol(std::string(otherLength, 'a').c_str(), 0), nullptr) << length;
        }
    }
}

TEST(ScriptInfo, DebugMembersNeedDebugMode) {
    Settings settings;
    Dot dot;
    auto found = [&] { return std::string(dot.Invoke("Trace").ToString("")); };
    EXPECT_EQ(found(), "base");  // no configuration
    g_ScriptConfig = &settings.m_Config;
    EXPECT_EQ(found(), "base");  // no callback
    bool isDebug = false;
    settings.m_Config.m_UserData = &isDebug;
    settings.m_Config.IsDebugMode = [](void* user, TagList*) { return *static_cast<bool*>(user); };
    EXPECT_EQ(found(), "base");
    isDebug = true;
    EXPECT_EQ(found(), "traced");
}

TEST(ScriptSymbol, KeepsItsHelp) {
    const ScriptSymbol& add = *__ScriptInfo_Shape.FindSymbol("Add", 0);
    EXPECT_TRUE(add.GetShortHelp() == "Adds numbers.");
    EXPECT_EQ(add.GetAttrName(), nullptr);
    std::string order;
    TagList* tags = add.GetHelpTags();
    for (auto item = tags->First(); item; item = tags->Next(item)) {
        order += *item == SYMT_Optional ? (tags->GetBool(item) ? "[" : "]") : tags->GetString(item);
    }
    EXPECT_EQ(order, "Adds numbers.use[number]");
    EXPECT_STREQ(__ScriptInfo_Shape.FindSymbol("Size", 0)->GetAttrName(), "size");

    TagList own, current;
    own.Set(SYMT_ShortHelp, "own", true);
    current.Set(SYMT_AttrName, "current", true);
    g_CurHelp = &current;
    ScriptSymbolT<Dot> symbol;
    EXPECT_TRUE(symbol.GetShortHelp() == "");
    symbol.Init(1, "X", SST_Variable, __ScriptInfo_Dot, &own);
    EXPECT_EQ(g_CurHelp, nullptr);
    EXPECT_TRUE(symbol.GetShortHelp() == "own" && OxID(symbol.GetAttrName()) == "current");
    symbol.Init(1, "X", SST_Variable, __ScriptInfo_Dot, nullptr);
    EXPECT_EQ(symbol.GetAttrName(), nullptr);
}

TEST(ScriptObject, InvokesByName) {
    Circle circle;
    Shape& shape = circle;
    circle.SetScriptInfo(&__ScriptInfo_Shape);
    EXPECT_TRUE(shape.Invoke("Add") == 1);
    EXPECT_TRUE(shape.Invoke("Add", 1, 1, 1, 1, 1, 1, 1, 1) == 9);
    EXPECT_TRUE(shape.Invoke("Add", "text", ScriptVal(), 4u) == 5);
    EXPECT_TRUE(shape.Invoke("Size") == 1);
    EXPECT_TRUE(shape.Invoke("Grow") == "circle");  // virtually
    for (const char* name : {"NoSuch", "About", "Fail"}) EXPECT_TRUE(shape.Invoke(name, 1).IsNil());

    ScriptArgs args, failed;
    args[1] = 10;
    EXPECT_TRUE(shape.InvokeA("Add", args) && args[-1] == 11 && args[-2] == "Add");
    EXPECT_FALSE(shape.InvokeA("NoSuch", args));
    EXPECT_TRUE(shape.InvokeA("Fail", failed) && failed["Error"] == int{SCERR_InvalidArgs});

    shape.InvokeSet("Size", 5);
    EXPECT_TRUE(shape.InvokeGet("Size") == 5 && shape.InvokeGet("Add").IsNil());
    shape.InvokeSet("Name", "x");
    EXPECT_TRUE(shape.InvokeGet("Name") == "shape");  // cannot be written
    shape.InvokeSet("Secret", "y");
    EXPECT_TRUE(shape.InvokeGet("Name") == "y" && shape.InvokeGet("Secret").IsNil());  // nor read
    ScriptVal value(&circle);
    EXPECT_TRUE(value.CallMember("Add", 1) == 6 && value.CallMember("Size").IsNil());

    EXPECT_TRUE(_Object().Invoke("Add").IsNil());
}

// The sanitizer does not look, so that it lets the null object pass.
__attribute__((noinline, no_sanitize("vptr"))) void DumpMem(ScriptObject* object, unsigned flags) {
    object->DumpMem(flags);
}

TEST(ScriptObject, DumpsItsMemoryOnce) {
    Settings settings;
    static std::vector<std::pair<void*, unsigned>> s_Dumped;
    g_ScriptHooks.m_IncludeMemory = [](void* memory, unsigned size) {
        s_Dumped.push_back({memory, size});
    };
    _Object whole, without;
    for (int i = 0; i < 2; i++) DumpMem(&whole, 2);
    DumpMem(&without, 1);
    DumpMem(nullptr, 0);
    ASSERT_EQ(s_Dumped.size(), 1u);
    EXPECT_EQ(s_Dumped[0], (std::pair<void*, unsigned>(&whole, sizeof(_Object))));
}

TEST(ScriptObject, CopiesHaveTheirOwnClass) {
    Dot dot;
    Circle copy(dot);
    EXPECT_EQ(copy.GetScriptInfo(), nullptr);  // not Dot's, whose members would take it for a Dot
    copy = dot;
    EXPECT_EQ(copy.GetScriptInfo(), nullptr);
}

TEST(ScriptObject, CallScriptFuncTakesTheOpcodes) {
    Panel panel;
    _Object bare;
    ScriptArgs args;
    args[1] = "text";
    EXPECT_FALSE(CallScriptFunc(&panel, "NoSuch", args, nullptr));  // its SST_GetTable gives 1
    EXPECT_TRUE(args[-1].IsNil());
    EXPECT_TRUE(CallScriptFunc(&panel, "Echo", args, nullptr));
    EXPECT_TRUE(args[-1] == "text");
    EXPECT_FALSE(CallScriptFunc(&bare, "Add", args, nullptr));  // no opcodes
    EXPECT_FALSE(CallScriptFunc(nullptr, "Add", args, nullptr));
}

TEST(ScriptObject, DoInfoTellsWhatIsWanted) {
    Dot dot;
    ScriptVal offer, table(SV_Table, nullptr);
    table["UseCount"] = true;
    table["Other"] = 1;
    EXPECT_FALSE(dot.DoInfo(ScriptVal(), offer, "UseCount"));
    EXPECT_TRUE(offer["UseCount"] == true);
    for (const ScriptVal& query : {ScriptVal("UseCount"), ScriptVal("*"), table}) {
        EXPECT_TRUE(dot.DoInfo(query, offer, "UseCount"));
        EXPECT_EQ(dot.DoInfo(query, offer, "Other"), query == "*");
    }
    EXPECT_FALSE(dot.DoInfo("usecount", offer, "UseCount") || dot.DoInfo(5, offer, "UseCount"));
}

TEST(ScriptSymbol, PacesReplies) {
    Panel one, two;
    auto delay = [](ScriptObject& object, const char* name, bool set = false) {
        ScriptArgs args;
        object.GetScriptInfo()->FindSymbol(name, 0)->Call(&object, args, set);
        EXPECT_EQ(args.m_Flags & (SVF_CallDelay | SVF_ForceDelay), 0u);
        return args.Exists("__delay") ? args["__delay"].ToNumber() : -1;
    };
    EXPECT_EQ(delay(one, "Both"), -1);
    for (bool set : {false, true}) {  // one pace for a symbol: of all objects, reads and writes
        double waits = delay(two, "Both", set);
        EXPECT_TRUE(waits > 0 && waits <= 500) << waits;
    }
    EXPECT_EQ(delay(one, "Both"), 500);  // never longer
    EXPECT_EQ(delay(one, "Reads"), -1);
    EXPECT_EQ(delay(one, "Reads", true), -1);
    EXPECT_GT(delay(one, "Reads"), 0);
    for (int i = 0; i < 2; i++) {
        EXPECT_EQ(delay(one, "Exempt"), -1);
        EXPECT_EQ(delay(one, "Slow"), 500);
    }
}

// Each call gets a UI thread of its own.
unsigned long long ExecuteOnUIThread(ScriptConfig::UIFunction function, void* a, void* b,
                                     bool wait) {
    EXPECT_TRUE(wait && !IsGUIThread());  // which would wait for itself
    std::thread([=] {
        SetGUIThread(Platform::GetCurrentThreadID());
        EXPECT_EQ(function(a, b), 0u);
    }).join();
    return 0;
}

TEST(ScriptSymbol, RunsOnTheUIThread) {
    Settings settings;
    Panel panel;
    EXPECT_TRUE(IsGUIThread());  // of whoever has loaded the library
    g_ScriptConfig = &settings.m_Config;
    settings.m_Config.UIExecute = ExecuteOnUIThread;
    g_NoGUI = false;
    EXPECT_TRUE(panel.Invoke("OnUI") == true);  // on the same thread, at once
    SetGUIThread(1);
    g_NoGUI = true;
    EXPECT_TRUE(panel.Invoke("OnUI") == false);  // nobody has said that there is a UI
    g_NoGUI = false;
    EXPECT_TRUE(panel.Invoke("Anywhere") == false);
    ScriptArgs args;
    EXPECT_TRUE(panel.InvokeA("OnUI", args) && args[-1] == true && args["__delay"].ToNumber() > 0);

    static std::vector<std::string> s_Lines;
    g_ScriptHooks.m_Log = [](const char* line) { s_Lines.push_back(line); };
    SetGUIThread(1);
    settings.m_Config.UIExecute = nullptr;
    for (ScriptConfig* config : {&settings.m_Config, static_cast<ScriptConfig*>(nullptr)}) {
        g_ScriptConfig = config;
        EXPECT_TRUE(panel.Invoke("OnUI") == false);
    }
    ASSERT_EQ(s_Lines.size(), 1u);
    EXPECT_NE(s_Lines[0].find("UIExecute"), std::string::npos);
}

// While a class's parent is found, every look-up finds every member, and walks end.
TEST(ScriptInfo, ReadersWalkWhileConstantsMove) {
    constexpr int kMembers = 60;  // every third is a function
    Dot dot;                      // for the parent
    std::vector<std::string> names;
    for (int i = 0; i < kMembers; i++) names.push_back("member" + std::to_string(i));
    for (int round = 0; round < 100; round++) {
        ScriptInfoT<Dot> info(1, "RunTime", "", "");
        std::vector<ScriptSymbolT<Dot>> symbols(kMembers);
        for (int i = 0; i < kMembers; i++) {
            symbols[i].Init(1, names[i].c_str(), i % 3 ? SST_Constant : SST_Function, info, {});
        }
        std::atomic<bool> isKnown{false};
        std::atomic<int> walks{0};
        auto read = [&] {
            for (bool isLast = false; !isLast; walks++) {
                isLast = isKnown.load();
                size_t missed = 0, functions = 0;
                for (const std::string& name : names) {
                    missed += info.FindSymbol(name.c_str(), 0) == nullptr;
                }
                for (ScriptSymbol& symbol : info.GetSymbols()) {
                    functions += symbol.GetKind() == SST_Function;
                }
                EXPECT_TRUE(missed == 0 && functions == kMembers / 3u);
            }
        };
        std::thread readers[] = {std::thread(read), std::thread(read)};
        while (walks < 2) std::this_thread::yield();
        _InitScriptInfo(info, &__ScriptInfo_Dot);
        isKnown = true;
        for (std::thread& reader : readers) reader.join();
        EXPECT_EQ(__ScriptInfo_Circle.FindSymbol("member1", 0), &symbols[1]);
    }
    EXPECT_EQ(__ScriptInfo_Dot.FindSymbol("member1", 0), nullptr);
}

#ifdef KORVEL_FAULTS
TEST(ScriptObject, AnyAllocationMayFail) {
    Dot dot;
    dot.SetScriptInfo(&__ScriptInfo_Shape);
    ScriptInfoT<Dot> info(1, "Run", "", "");
    ScriptVal topic = "AnyShape:Add", wholeHelp = dot.Invoke("GetHelp", topic);
    unsigned count = 1;
    for (unsigned n = 1; n <= count; n++) {
        for (bool forGood : {false, true}) {
            Faults::FailAt(n, forGood);
            ScriptVal sum = dot.Invoke("Add", 2, 3, "text");
            ScriptArgs args;
            dot.InvokeA("Add", args);
            dot.InvokeSet("Size", 1);  // never to nothing
            Panel panel;
            CallScriptFunc(&panel, "Echo", args, nullptr);
            ScriptVal help = dot.Invoke("GetHelp", topic);
            ScriptVal attributes = dot.Invoke("GetAttrs");
            {
                ScriptSymbolT<Dot> symbol(nullptr, "Member", SST_Variable, info,
                                          {{SYMT_ShortHelp, "Short."}, {SYMT_AttrName, "attr"}});
                ScriptSymbol* found = info.FindSymbol("Member", 0);
                EXPECT_TRUE(found == nullptr || found == &symbol);
            }
            count = std::max(count, Faults::Stop());
            EXPECT_EQ(dot.m_Size, 1);
            EXPECT_TRUE(help.IsNil() || help == wholeHelp) << help.ToString("");
            EXPECT_TRUE(attributes.IsNil() || attributes.IsTable());
            EXPECT_TRUE(sum.IsNil() || sum.IsNumber()) << n;
            EXPECT_TRUE(info.GetSymbols().begin() == info.GetSymbols().end());
        }
    }
    EXPECT_GT(count, 10u);
}
#endif

}  // namespace

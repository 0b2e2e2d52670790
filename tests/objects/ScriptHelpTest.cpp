// The help of classes and members, as text and as tables.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "core/RefObject.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"

namespace {

using namespace Korvel;

class Reel : public Scripted<_Object> {
    KORVEL_SCRIPTED(Reel)
public:
    Reel() { SetScriptClass(); }
};

KORVEL_PUBLISH(Reel, "HelpReel", "Holds tape.", "A long story.")
KORVEL_FUNCTION(Reel, Wind, 0, {SYMT_ShortHelp, "Turns it."}, {SYMT_Body, "First."},
                {SYMT_Usage, "To a place."}, {SYMT_ReturnType, "number"}, {SYMT_ReturnName, "at"},
                {SYMT_ArgType, "string"}, {SYMT_ArgName, "place"}, {SYMT_Optional, true},
                {SYMT_ArgType, "number"}, {SYMT_ArgName, "speed"}, {SYMT_ArgType, "boolean"},
                {SYMT_Usage, "Described."}, {SYMT_ReturnType, "number"},
                {SYMT_ReturnType, "string"}, {SYMT_ReturnDesc, "why"}, {SYMT_ArgType, "table"},
                {SYMT_ArgDesc, "options"}, {SYMT_Optional, true}, {SYMT_ArgType, "number"},
                {SYMT_Usage, nullptr}, {SYMT_SeeAlso, "Unwind"}, {SYMT_CodeLanguage, "Lua"},
                {SYMT_CodeLabel, "Sample"}, {SYMT_Code, "reel:Wind()"}, {SYMT_Code, "more()"}) {}
KORVEL_VARIABLE(Reel, Size, SSF_Read | SSF_Write, {SYMT_ShortHelp, "In meters - of tape."},
                {SYMT_Usage, "Reads."}, {SYMT_ReturnType, "number"}, {SYMT_Usage, "Writes."},
                {SYMT_ArgType, "number"}) {}
KORVEL_VARIABLE(Reel, In, SSF_Write) {}
KORVEL_CONSTANT(Reel, ReelLimit, 0) {}
KORVEL_HELP(Reel, Care, {SYMT_Body, "Keep it dry."});
KORVEL_FUNCTION(Reel, Hidden, SSF_Hidden) {}
KORVEL_VARIABLE(Reel, Debugged, SSF_Read | SSF_Debug) {}
KORVEL_PUBLISHED(Reel);

class Spool : public Reel {
    KORVEL_SCRIPTED(Spool)
public:
    Spool() { SetScriptClass(); }
};

KORVEL_PUBLISH(Spool, "HelpSpool", "", "")
KORVEL_PUBLISHED(Spool);

// A class that has had no object.
ScriptInfoT<Reel> s_Unbuilt(1, "HelpUnbuilt", "", "");
ScriptSymbolT<Reel> s_Own(nullptr, "Own", SST_Function, s_Unbuilt);

class Debugging {
public:
    Debugging() {
        m_Config.IsDebugMode = [](void*, TagList*) { return true; };
        g_ScriptConfig = &m_Config;
    }
    Debugging(const Debugging&) = delete;
    Debugging& operator=(const Debugging&) = delete;
    ~Debugging() { g_ScriptConfig = nullptr; }

private:
    ScriptConfig m_Config;
};

std::string Help(const ScriptVal& topic) {
    return Spool().Invoke("GetHelp", topic).ToString("nil");
}

// In one line: texts as they are, tables as {key=value ...}, lists as [value ...].
std::string Show(const ScriptVal& value) {
    if (value.IsBoolean()) return value.ToBoolean() ? "yes" : "no";
    if (!value.IsTable()) return value.ToString("nil");
    std::string text;
    bool isList = true;
    for (TableEntry* entry = nullptr; value.NextKey(entry);) {
        if (!text.empty()) text += " ";
        isList = entry->m_Key.IsNumber();
        if (!isList) text += std::string(entry->m_Key.ToString()) + "=";
        text += Show(entry->m_Value);
    }
    return isList ? "[" + text + "]" : "{" + text + "}";
}

std::string Raw(const ScriptVal& className, const ScriptVal& member = {}) {
    return Show(Spool().Invoke("GetHelpRaw", className, member));
}

TEST(ScriptHelp, TellsAboutAMember) {
    EXPECT_EQ(Help("HelpSpool:Wind"),
              "HelpReel:Wind() - Turns it.\n\n"
              "number HelpReel:Wind(string place [, number speed [, boolean]])\n"
              "  To a place.\n\n"
              "number HelpReel:Wind()\n"  // one result, and nothing behind it
              "  Described.\n\n"
              "HelpReel:Wind()\n"
              "First.\n\nreel:Wind()\n\nmore()\n\n")
        << "the class that declares it";
    EXPECT_EQ(Help("HelpReel.Size"),
              "HelpReel.Size [RW] - In meters - of tape.\n\n"
              "number = HelpReel.Size\n  Reads.\n\nHelpReel.Size = number\n  Writes.\n\n");
    EXPECT_EQ(Help("HelpReel/Care"), "HelpReel/Care\n\nKeep it dry.\n\n");
    EXPECT_EQ(Help("HelpReel:In"), "HelpReel.In [W]\n\n") << "any of the marks will do";
    EXPECT_EQ(Help("HelpReel.ClassName").substr(0, 14), ".ClassName [R]");
    for (const char* none : {"HelpReel.None", "HelpReel:Hidden", "HelpReel.ReelLimit", "None",
                             "HelpUnbuilt:Own", "HelpReel.Debugged", "helpreel", "HelpReel.."}) {
        EXPECT_EQ(Help(none), "nil") << none;
    }
    EXPECT_EQ(Help(5), "nil");
    Debugging debug;
    EXPECT_EQ(Help("HelpReel:Hidden"), "HelpReel:Hidden()\n\n");
}

TEST(ScriptHelp, ListsMembersInOneColumn) {
    Reel reel;  // its parent is known from here on
    std::string list = Help("HelpReel");
    EXPECT_EQ(list.substr(0, list.find("  .ClassName")),
              "HelpReel Members:\n"
              "  HelpReel/Care\n"
              "  HelpReel.In [W]\n"
              "  HelpReel.Size [RW]  - In meters - of tape.\n"
              "  HelpReel:Wind()     - Turns it.\n");
    EXPECT_NE(list.find("  :GetApp()           - Returns the application object.\n"), list.npos);
    EXPECT_EQ(Help("HelpReel:"), list);
    EXPECT_EQ(Help("HelpSpool"), "HelpSpool" + list.substr(8));

    std::string classes = Help("");
    EXPECT_EQ(classes, Help({}));
    EXPECT_EQ(classes.substr(0, 10), "\nClasses:\n");
    EXPECT_EQ(classes.find("HelpSpool"), classes.npos) << "nothing of its own";
    size_t line = classes.find("  HelpReel ");
    ASSERT_NE(line, classes.npos);
    EXPECT_NE(classes.find("- Holds tape.\n", line), classes.npos);
}

TEST(ScriptHelp, FillsTables) {
    Reel reel;
    EXPECT_EQ(Raw("HelpReel"),
              "{ShortHelp=Holds tape. LongHelp=A long story. Members=[Care In Size Wind]}");
    EXPECT_EQ(Raw("HelpSpool"), "{Parent=HelpReel ShortHelp= LongHelp= Members=[]}");
    EXPECT_EQ(Raw("HelpUnbuilt", ""), "{ShortHelp= LongHelp= Members=[Own]}");
    std::string wind = Raw("HelpReel", "Wind");
    EXPECT_EQ(wind.substr(0, 48), "{Name=Wind ShortHelp=Turns it. LongHelp=number H");
    EXPECT_EQ(wind.substr(wind.find("Type=Function")),
              "Type=Function Usage=["
              "{Description=To a place. Returns=[{Type=number Name=at}] "
              "Args=[{Optional=no Type=string Name=place} {Optional=yes Type=number Name=speed} "
              "{Optional=yes Type=boolean}]} "
              "{Description=Described. Returns=[{Type=number} {Type=string Description=why}] "
              "Args=[{Optional=no Type=table Description=options} {Optional=yes Type=number}]} "
              "{Returns=[] Args=[]}] "
              "Description=[{Text=First. Type=Body} "
              "{Text=reel:Wind() Type=Code Language=Lua Label=Sample} {Text=more() Type=Code}] "
              "SeeAlso=[{Text=Unwind}]}");
    EXPECT_NE(Raw("HelpReel", "In").find("Type=Variable VarRead=no VarWrite=yes Usage"),
              size_t(-1));
    for (const char* member : {"None", "ReelLimit", "Hidden"})
        EXPECT_EQ(Raw("HelpReel", member), "nil");
    EXPECT_EQ(Raw("HelpSpool", "Wind"), "nil") << "its own alone";
    EXPECT_EQ(Raw("None") + Raw(5) + Raw(5, "Wind"), "nilnilnil");
    {
        Debugging debug;
        EXPECT_EQ(Raw("HelpReel", "Hidden"),
                  "{Name=Hidden ShortHelp= LongHelp= Type=Function Hidden=yes Debug=no "
                  "Usage=[] Description=[] SeeAlso=[]}");
    }
    auto has = [](const std::string& names) { return names.find("HelpSpool") != names.npos; };
    EXPECT_TRUE(has(Raw({})) && has(Raw("")) && has(Raw(true)) && has(Raw({}, "Wind")));
    EXPECT_FALSE(has(Raw(false)));

    // Of two with one name the text is of the newer one, the table of the older.
    ScriptInfoT<Reel> newer(1, "HelpReel", "Newer.", "");
    ScriptSymbolT<Reel> symbol(nullptr, "Extra", SST_Function, newer);
    EXPECT_EQ(Raw("HelpReel").substr(0, 22), "{ShortHelp=Holds tape.");
    EXPECT_EQ(Raw("HelpReel", "Extra").substr(0, 11), "{Name=Extra");
    EXPECT_EQ(Help("HelpReel:Extra"), "nil") << "its parent is not known";
    _InitScriptInfo(newer, nullptr);
    EXPECT_EQ(Help("HelpReel:Extra"), "HelpReel:Extra()\n\n");
    EXPECT_NE(Help("HelpReel:Wind"), "nil") << "the first that has it";
}

}  // namespace

#include <algorithm>
#include <cstring>
#include <utility>

#include "objects/ScriptConfig.h"
#include "objects/ScriptHelpInternal.h"
#include "objects/ScriptSymbol.h"

namespace Korvel {
namespace {

// Values at keys 1, 2 and so on.
class HelpList {
public:
    ScriptVal& Add() { return m_Values.FindKey(++m_Count, SVF_Int, SVF_Int); }
    ScriptVal& AddTable() {
        ScriptVal& table = Add();
        table = SV_Table;
        return table;
    }
    ScriptVal Take() { return std::move(m_Values); }

private:
    ScriptVal m_Values{SV_Table, nullptr};
    int m_Count = 0;
};

const char* GetTypeName(uint32_t kind) {
    switch (kind) {
        case SST_Function:
            return "Function";
        case SST_Variable:
            return "Variable";
        case SST_Constant:
            return "Constant";
        case SST_Help:
            return "Help";
        default:
            return "Unknown";
    }
}

// One way to call the member, from the tags behind the one that opens it.
void FillUsage(ScriptVal& usage, const char* description, HelpTags tags) {
    HelpList returns, args;
    const char* text;
    while (tags.Take(SYMT_ReturnType, text)) {
        ScriptVal& table = returns.AddTable();
        table["Type"] = text;
        if (tags.Take(SYMT_ReturnName, text)) table["Name"] = text;
        if (tags.Take(SYMT_ReturnDesc, text)) table["Description"] = text;
    }
    bool isOptional = false;
    for (;;) {
        if (tags.Take(SYMT_Optional, isOptional)) continue;
        if (!tags.Take(SYMT_ArgType, text)) break;
        ScriptVal& table = args.AddTable();
        table["Optional"] = isOptional;
        table["Type"] = text;
        if (tags.Take(SYMT_ArgName, text)) table["Name"] = text;
        if (tags.Take(SYMT_ArgDesc, text)) table["Description"] = text;
    }
    usage["Description"] = description;
    usage["Returns"] = returns.Take();
    usage["Args"] = args.Take();
}

void FillFromTags(ScriptVal& table, const TagList& list) {
    HelpList usages, descriptions, references;
    const char* language = nullptr;
    const char* label = nullptr;
    const char* text;
    for (HelpTags tags(list); tags;) {
        if (tags.Take(SYMT_Usage, text)) {
            FillUsage(usages.AddTable(), text, tags);
        } else if (tags.Take(SYMT_SeeAlso, text)) {
            references.AddTable()["Text"] = text;
        } else if (tags.Take(SYMT_Body, text)) {
            ScriptVal& body = descriptions.AddTable();
            body["Text"] = text;
            body["Type"] = "Body";
        } else if (tags.Take(SYMT_Code, text)) {
            ScriptVal& code = descriptions.AddTable();
            code["Text"] = text;
            code["Type"] = "Code";
            if (language) code["Language"] = language;
            if (label) code["Label"] = label;
            language = label = nullptr;
        } else if (!tags.Take(SYMT_CodeLanguage, language) && !tags.Take(SYMT_CodeLabel, label)) {
            tags.Step();
        }
    }
    table["Usage"] = usages.Take();
    table["Description"] = descriptions.Take();
    table["SeeAlso"] = references.Take();
}

ScriptVal MakeClassTable(const ScriptInfo& info) {
    ScriptVal table(SV_Table, nullptr);
    const ScriptInfo* parent = info.GetParent();
    if (parent && *parent->GetName()) table["Parent"] = parent->GetName();
    table["ShortHelp"] = info.GetShortHelp();
    table["LongHelp"] = info.GetLongHelp();
    HelpList members;
    for (const ScriptSymbol& symbol : info.GetSymbols()) {
        if (IsInHelp(symbol)) members.Add() = symbol.GetName();
    }
    table["Members"] = members.Take();
    return table;
}

ScriptVal MakeMemberTable(const ScriptSymbol& symbol) {
    ScriptVal table(SV_Table, nullptr);
    uint32_t flags = symbol.GetFlags();
    table["Name"] = symbol.GetName();
    table["ShortHelp"] = symbol.GetShortHelp();
    table["LongHelp"] = symbol.GetLongHelp();
    table["Type"] = GetTypeName(symbol.GetKind());
    if (symbol.GetKind() == SST_Variable) {
        table["VarRead"] = (flags & SSF_Read) != 0;
        table["VarWrite"] = (flags & SSF_Write) != 0;
    }
    if (IsDebugMode()) {
        table["Hidden"] = (flags & SSF_Hidden) != 0;
        table["Debug"] = (flags & SSF_Debug) != 0;
    }
    if (symbol.GetHelpTags()) FillFromTags(table, *symbol.GetHelpTags());
    return table;
}

// Of several classes with one name the last one that has something to tell.
template <class Make>
ScriptVal AskClasses(const char* className, Make make) {
    ScriptVal table;
    for (const ScriptInfo* info = g_ScriptInfoList; info; info = info->GetNext()) {
        if (strcmp(info->GetName(), className) == 0) make(*info, table);
    }
    return table;
}

}  // namespace

ScriptVal GetClassNames(bool all) {
    HelpList names;
    for (const ScriptInfo* info = g_ScriptInfoList; info; info = info->GetNext()) {
        SymbolRange symbols = info->GetSymbols();
        if (*info->GetName() && (all || symbols.begin() != symbols.end())) {
            names.Add() = info->GetName();
        }
    }
    return names.Take();
}

ScriptVal GetClassTable(const char* className) {
    return AskClasses(
        className, [](const ScriptInfo& info, ScriptVal& table) { table = MakeClassTable(info); });
}

ScriptVal GetMemberTable(const char* className, const char* member) {
    return AskClasses(className, [member](const ScriptInfo& info, ScriptVal& table) {
        SymbolRange symbols = info.GetSymbols();
        auto found = std::find_if(symbols.begin(), symbols.end(), [&](const ScriptSymbol& symbol) {
            return symbol.GetName() == member && IsInHelp(symbol);
        });
        if (found != symbols.end()) table = MakeMemberTable(*found);
    });
}

}  // namespace Korvel

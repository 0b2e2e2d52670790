// The root of all classes, and the members that every object has from it: those by which scripts
// index and call objects, and the ones for help and attributes.
#include <cstring>
#include <utility>

#include "objects/LiveSymbolsInternal.h"
#include "objects/ObjectReferences.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "objects/ScriptHelpInternal.h"
#include "objects/ScriptObject.h"
#include "objects/ScriptSymbol.h"

namespace Korvel {
namespace {

struct RootInfo : ScriptInfoT<ScriptObject> {
    RootInfo() : ScriptInfoT(1, "", "", "") { BecomeRoot(); }
};

// Constructed before, and destroyed after, the records of hosts, which come to its list; where the
// library is linked as an archive, theirs may stand ahead of all else in this one.
__attribute__((init_priority(102))) RootInfo __ScriptInfo_ScriptObject;

ScriptSymbol* FindOpcode(const ScriptObject& object, unsigned int opcode) {
    const ScriptInfo* info = object.GetScriptInfo();
    return info ? info->FindSymbol(nullptr, opcode) : nullptr;
}

ScriptSymbol* FindMember(const ScriptObject& object, const char* name) {
    const ScriptInfo* info = object.GetScriptInfo();
    return info && name ? info->FindSymbol(name, 0) : nullptr;
}

// Argument `position`; nil, with no entry made, when there is none.
const ScriptVal& Argument(const ScriptArgs& args, int position) {
    return args[position];
}

// Whether results may be added or moved: a member may have taken the list over, for a later reply,
// or made something else of it.
bool IsReplyOpen(const ScriptArgs& args) {
    return args.IsArgs() && !(args.m_Flags & SVF_ReplyDeferred);
}

// Index

void ReturnFunction(ScriptArgs& args, ScriptSymbol* symbol, uint32_t flags) {
    if (symbol->GetFlags() & SSF_AnyThread) flags |= SVF_AnyThreadFunc;
    auto address = reinterpret_cast<uint64_t>(symbol);
    args.Return().Set(SV_Function | flags, &address);
}

void ReturnMember(ScriptObject& object, ScriptArgs& args, ScriptSymbol* symbol) {
    switch (symbol->GetKind()) {
        case SST_Function:
            ReturnFunction(args, symbol, 0);
            break;
        case SST_Variable:
        case SST_Constant:
            symbol->Call(&object, args, false);
            break;
        default:
            args.ReturnNil();
            break;
    }
}

// The function "Name" for "NameTable", which calls it and packs what it returns.
ScriptSymbol* FindPackedFunction(const ScriptObject& object, const char* name) {
    constexpr char kEnding[] = "Table";
    constexpr size_t kEndingLength = sizeof kEnding - 1;
    constexpr size_t kMaxLength = 79;
    size_t length = strnlen(name, kMaxLength + 1);
    if (length <= kEndingLength || length > kMaxLength) return nullptr;
    size_t stemLength = length - kEndingLength;
    if (strcmp(name + stemLength, kEnding) != 0) return nullptr;
    char stem[kMaxLength];
    memcpy(stem, name, stemLength);
    stem[stemLength] = 0;
    ScriptSymbol* symbol = FindMember(object, stem);
    return symbol && symbol->GetKind() == SST_Function ? symbol : nullptr;
}

// What makes objects of the class with this name.
ScriptSymbol* FindCreate(const char* className) {
    for (ScriptInfo* info = g_ScriptInfoList; info; info = info->GetNext()) {
        if (strcmp(info->GetName(), className) != 0) continue;
        ScriptSymbol* create = info->FindSymbol(nullptr, SST_Create);
        if (create && create->IsPresent()) return create;
    }
    return nullptr;
}

// False when the class has nothing for such keys.
bool CallUnknown(ScriptObject& object, ScriptArgs& args) {
    ScriptSymbol* unknown = FindOpcode(object, SST_GetTableUnknown);
    if (unknown) unknown->Call(&object, args, false);
    return unknown != nullptr;
}

void Index(ScriptObject& object, ScriptArgs& args) {
    const char* name = Argument(args, 0).ToString();
    if (!name) {
        if (!CallUnknown(object, args)) args.SetError(SCERR_InvalidIndex);
        return;
    }
    if (ScriptSymbol* symbol = FindMember(object, name)) {
        ReturnMember(object, args, symbol);
    } else if (ScriptSymbol* packed = FindPackedFunction(object, name)) {
        ReturnFunction(args, packed, SVF_TableResult);
    } else {
        CallUnknown(object, args);
    }
    if (!IsReplyOpen(args) || args.m_Value.m_Args.m_NumReturns) return;
    name = Argument(args, 0).ToString();  // the member may have changed it
    ScriptSymbol* create = name ? FindCreate(name) : nullptr;
    if (create) {
        ReturnFunction(args, create, 0);
    } else {
        args.ReturnNil();
    }
}

// Calls

// Puts all results into one table, which becomes the only one.
void PackResults(ScriptArgs& args) {
    if (!IsReplyOpen(args)) return;
    ScriptVal table(SV_Table, nullptr);
    int count = std::exchange(args.m_Value.m_Args.m_NumReturns, uint8_t{0});
    for (int i = 1; i <= count; i++) {
        ScriptVal& value = table.FindKey(i, SVF_Int, SVF_Int);
        value = std::move(args[-i]);
        value.m_Flags &= ~SVF_ReadOnly;
    }
    args.Return() = std::move(table);
}

void CallFunctionValue(ScriptObject& object, ScriptArgs& args) {
    const ScriptVal& function = Argument(args, 0);
    if (!function.IsFunction()) return;
    bool isPacked = (function.m_Flags & SVF_TableResult) != 0;
    HeldSymbol symbol(function.ToFunction(), object);
    if (!symbol) return args.SetError(SCERR_UnknownSymbol);
    symbol->Call(&object, args, false);
    if (isPacked) PackResults(args);
}

// Asks the object what it has under a key, and calls it with `args` if it is a function.
bool CallByKey(ScriptObject& object, const ScriptVal& key, ScriptArgs& args) {
    ScriptSymbol* getTable = FindOpcode(object, SST_GetTable);
    if (!getTable) return false;
    ScriptArgs lookUp;
    lookUp.SetApp(args.GetApp());
    if (!lookUp.SetPosition(0, key)) return false;
    getTable->Call(&object, lookUp, false);
    const ScriptVal& function = Argument(lookUp, -1);
    if (!function.IsFunction()) return false;
    ScriptSymbol* callFunction = FindOpcode(object, SST_CallFunction);
    if (!callFunction || !args.SetPosition(0, function)) return false;
    callFunction->Call(&object, args, false);
    return true;
}

// Whether the value is half of a 64-bit number.
bool GetHalf(const ScriptVal& value, uint64_t& half) {
    double number = value.ToNumber(-1);
    if (!(number >= 0 && number <= UINT32_MAX)) return false;  // nor is NaN
    half = static_cast<uint64_t>(number);
    return static_cast<double>(half) == number;
}

// The number that stands at two positions of the arguments; 0 when they have none.
uint64_t JoinHalves(const ScriptArgs& args, int position) {
    uint64_t low, high;
    bool isNumber = GetHalf(args[position], low) && GetHalf(args[position + 1], high);
    return isNumber ? low | high << 32 : 0;
}

// Attributes

// Calls `visit` with each variable that is an attribute and has the flag, from the object's class
// upward.
template <class Visit>
void ForAttributes(const ScriptObject& object, uint32_t flag, Visit visit) {
    for (const ScriptInfo* info = object.GetScriptInfo(); info; info = info->GetParent()) {
        for (ScriptSymbol& symbol : info->GetSymbols()) {
            bool isAttribute = symbol.GetKind() == SST_Variable && (symbol.GetFlags() & flag) &&
                               symbol.GetAttrName() && symbol.IsPresent();
            if (isAttribute) visit(symbol);
        }
    }
}

// Lets the class's own hook have its part in getting or setting.
void CallAttributeHook(ScriptObject& object, ScriptArgs& work, bool set) {
    if (ScriptSymbol* hook = FindOpcode(object, SST_GetSetAttrs)) hook->Call(&object, work, set);
}

void ReturnAttributes(ScriptObject& object, ScriptArgs& args) {
    ScriptArgs work;
    work.SetApp(args.GetApp());
    const ScriptVal& query = Argument(args, 1);
    if (!work.SetArguments(ScriptVal(SV_Table, nullptr), query)) return args.ReturnNil();
    const char* name = query.ToString();
    ForAttributes(object, SSF_Read, [&](ScriptSymbol& symbol) {
        if (name && strcmp(name, symbol.GetAttrName()) != 0) return;
        ScriptArgs read;
        read.SetApp(args.GetApp());
        symbol.Call(&object, read, false);
        work[1][symbol.GetAttrName()] = read.TakeResult();
    });
    CallAttributeHook(object, work, false);
    if (query.IsNil()) {
        args.Return() = std::move(work[1]);
    } else {
        args.Return(Argument(work, 1).FindKeyConst(query));
    }
}

void SetAttributes(ScriptObject& object, ScriptArgs& args) {
    ScriptArgs work;
    work.SetApp(args.GetApp());
    if (!work.SetArguments(Argument(args, 1))) return;
    ForAttributes(object, SSF_Write, [&](ScriptSymbol& symbol) {
        const ScriptVal& value = Argument(args, 1).FindKeyConst(symbol.GetAttrName());
        ScriptArgs write;
        write.SetApp(args.GetApp());
        if (value.KeepMe() && write.SetArguments(value)) symbol.Call(&object, write, true);
    });
    CallAttributeHook(object, work, true);
}

// Help

ScriptVal GetHelpTable(const ScriptVal& className, const ScriptVal& member) {
    if (!className.IsNil() && !className.IsString() && !className.IsBoolean()) return {};
    const char* name = className.ToString("");
    const char* memberName = member.ToString("");
    if (!*name) return GetClassNames(className.ToBoolean(true));
    return *memberName ? GetMemberTable(name, memberName) : GetClassTable(name);
}

class ScriptObject_Scripting {
public:
    KORVEL_OPCODE(ScriptObject, SST_ToString, 0) {
        const ScriptInfo* info = self.GetScriptInfo();
        OxStringT<char> text;
        text.PrintF("%s (%p)", info ? info->GetName() : "", static_cast<void*>(&self));
        args.Return() = ScriptVal(text, text.GetLength());
    }

    KORVEL_OPCODE(ScriptObject, SST_EQ, 0) {
        const ScriptVal& other = Argument(args, 1);
        args.ReturnBoolean(other.ToLocalObject() == &self);
    }

    KORVEL_OPCODE(ScriptObject, SST_SetTable, 0) {
        ScriptSymbol* member = FindMember(self, Argument(args, 0).ToString());
        if (member && member->GetKind() == SST_Variable) member->Call(&self, args, true);
    }

    KORVEL_OPCODE(ScriptObject, SST_GetTable, SSF_AnyThread) { Index(self, args); }

    KORVEL_OPCODE(ScriptObject, SST_CallFunction, SSF_AnyThread) { CallFunctionValue(self, args); }

    KORVEL_OPCODE(ScriptObject, SST_CallMemberFunction, 0) {
        CallByKey(self, Argument(args, 0), args);
    }

    KORVEL_OPCODE(ScriptObject, SST_GetObject, 0) {
        // The address is only compared: nothing is known of it.
        uint64_t address = JoinHalves(args, 1);
        ScriptObject* object = ObjectReferences::GetReferenceObject(JoinHalves(args, 3));
        if (object && reinterpret_cast<uint64_t>(object) == address) {
            args.ReturnObject(object);
        } else {
            args.ReturnNil();
        }
    }

    KORVEL_FUNCTION(ScriptObject, GetHelp, 0, {SYMT_ShortHelp, "Returns help as text."},
                    {SYMT_Usage,
                     "Lists the classes, or tells about one class or one of its members."},
                    {SYMT_ReturnType, "string"}, {SYMT_ReturnName, "help"}, {SYMT_Optional, true},
                    {SYMT_ArgType, "string"}, {SYMT_ArgName, "topic"},
                    {SYMT_ArgDesc,
                     "A class, or a class and a member with '.', ':' or '/' between."}) {
        const ScriptVal& topic = Argument(args, 1);
        bool isTopic = self.GetScriptInfo() && (topic.IsNil() || topic.IsString());
        args.Return() = isTopic ? GetHelpText(topic.ToString()) : ScriptVal();
    }

    KORVEL_FUNCTION(ScriptObject, GetHelpRaw, 0, {SYMT_ShortHelp, "Returns help as a table."},
                    {SYMT_Usage,
                     "Lists the names of the classes; with false, of those with members."},
                    {SYMT_ReturnType, "table"}, {SYMT_ReturnName, "names"}, {SYMT_Optional, true},
                    {SYMT_ArgType, "boolean"}, {SYMT_ArgName, "all"},
                    {SYMT_Usage, "Tells about a class or one of its members."},
                    {SYMT_ReturnType, "table"}, {SYMT_ReturnName, "help"}, {SYMT_ArgType, "string"},
                    {SYMT_ArgName, "className"}, {SYMT_Optional, true}, {SYMT_ArgType, "string"},
                    {SYMT_ArgName, "memberName"}) {
        args.Return() = GetHelpTable(Argument(args, 1), Argument(args, 2));
    }

    KORVEL_FUNCTION(ScriptObject, GetAttrs, 0, {SYMT_ShortHelp, "Reads attributes."},
                    {SYMT_Usage, "Returns all attributes by their names."},
                    {SYMT_ReturnType, "table"}, {SYMT_ReturnName, "attributes"},
                    {SYMT_Usage, "Returns one of them."}, {SYMT_ReturnType, "any"},
                    {SYMT_ReturnName, "value"}, {SYMT_ArgType, "string"}, {SYMT_ArgName, "name"}) {
        ReturnAttributes(self, args);
    }

    KORVEL_FUNCTION(ScriptObject, SetAttrs, 0, {SYMT_ShortHelp, "Writes attributes."},
                    {SYMT_Usage, "Writes those that the table has."}, {SYMT_ArgType, "table"},
                    {SYMT_ArgName, "attributes"}) {
        SetAttributes(self, args);
    }

    KORVEL_FUNCTION(ScriptObject, GetApp, 0, {SYMT_ShortHelp, "Returns the application object."},
                    {SYMT_Usage, nullptr}, {SYMT_ReturnType, "object"}) {
        args.ReturnObject(GetAppObject());
    }

    KORVEL_VARIABLE(ScriptObject, ClassName, SSF_Read, {SYMT_ShortHelp, "The name of the class."},
                    {SYMT_Usage, nullptr}, {SYMT_ReturnType, "string"}) {
        const ScriptInfo* info = self.GetScriptInfo();
        args.ReturnString(info ? info->GetName() : nullptr);
    }
};

// Behind the record, and ahead of all objects.
__attribute__((init_priority(103))) ScriptObject_Scripting s_ScriptObject_Scripting;

}  // namespace

ScriptInfo& GetRootScriptInfo() {
    return __ScriptInfo_ScriptObject;
}

bool CallScriptFunc(ScriptObject* object, const char* name, ScriptArgs& args, TagList*) {
    return object && CallByKey(*object, ScriptVal(name), args);
}

}  // namespace Korvel

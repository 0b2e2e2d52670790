#include "objects/ScriptObject.h"

#include "core/ScriptHooksInternal.h"
#include "objects/ObjectReferences.h"
#include "objects/ScriptSymbol.h"

namespace Korvel {

ScriptObject::~ScriptObject() {
    if (m_ObjectFlags.load(std::memory_order_relaxed) & SOF_HasReference) {
        ObjectReferences::ClearObjectReferences(this, false);
    }
}

bool ScriptObject::DoInfo(const ScriptVal& query, ScriptVal& result, const OxID& key) {
    switch (query.Type()) {
        case SV_Nil:
            if (result.IsNil()) result.Ensure(SV_Table);
            result[key] = true;
            return false;
        case SV_String:
            return query == key || query == "*";
        case SV_Table:
            return query[key].ToBoolean();
        default:
            return false;
    }
}

void ScriptObject::DoDumpMem(unsigned int flags) {
    if (!(flags & 1)) g_ScriptHooks.m_IncludeMemory(this, SizeOf());
}

void ScriptObject::DumpMem(unsigned int flags) {
    if (IsNull(this)) return;
    if (!(m_ObjectFlags.fetch_or(SOF_Dumped) & SOF_Dumped)) DoDumpMem(flags);
}

bool ScriptObject::InvokeKind(const OxID& name, unsigned int kind, ScriptArgs& args, bool set) {
    ScriptInfo* info = GetScriptInfo();
    ScriptSymbol* symbol = info ? info->FindSymbol(name, kind) : nullptr;
    if (symbol) symbol->Call(this, args, set);
    return symbol != nullptr;
}

ScriptVal ScriptObject::InvokeFirst(const OxID& name, unsigned int kind, ScriptArgs& args,
                                    bool set) {
    if (!InvokeKind(name, kind, args, set)) return {};
    return args.TakeResult();
}

bool ScriptObject::InvokeA(const OxID& name, ScriptArgs& args) {
    return InvokeKind(name, 0, args, false);
}

ScriptVal ScriptObject::InvokeGet(const OxID& name) {
    ScriptArgs args;
    return InvokeFirst(name, SST_Variable, args, false);
}

void ScriptObject::InvokeSet(const OxID& name, const ScriptVal& value) {
    ScriptArgs args;
    if (args.SetArguments(value)) InvokeKind(name, SST_Variable, args, true);
}

}  // namespace Korvel

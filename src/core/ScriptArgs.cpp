// Argument lists: results, replies, and the calls of members.
#include "core/ScriptHooksInternal.h"
#include "core/ScriptValInternal.h"
#include "objects/ScriptObject.h"
#include "objects/ScriptSymbol.h"

namespace Korvel {

RemoteApp* ScriptVal::GetApp() const {
    if (IsArgs()) return m_Value.m_Args.m_App;
    return IsRemoteObject() ? g_ScriptHooks.m_GetRemoteApp(m_Value.m_RemoteObject) : nullptr;
}

void ScriptVal::SetApp(RemoteApp* app) {
    if (!IsArgs() || IsReadOnly()) return;
    if (app) g_ScriptHooks.m_UseApp(app);
    RemoteApp* old = std::exchange(m_Value.m_Args.m_App, app);
    if (old) g_ScriptHooks.m_RecycleApp(old);
}

bool SendCommand(ScriptVal proxy, int opcode, ScriptArgs& args, ScriptVal& reply) {
    return g_ScriptHooks.m_DoCommand(proxy.ToRemoteObject(), opcode, args, reply);
}

ScriptVal ScriptVal::CallMemberA(const char* name, ScriptArgs& args) {
    if (IsRemoteObject()) {
        ScriptVal key(name);
        ScriptVal reply;
        bool isDone = !key.IsNil() && args.SetPosition(0, key) &&
                      SendCommand(*this, SST_CallMemberFunction, args, reply);
        return isDone ? reply.FindKeyConst(-1) : ScriptVal();
    }
    ScriptObject* object = ToLocalObject();
    ScriptInfo* info = object ? object->GetScriptInfo() : nullptr;
    ScriptSymbol* symbol = info ? info->FindSymbol(name, SST_Function) : nullptr;
    if (!symbol) return {};
    ScriptArgs copy(args);
    if (!copy.IsArgs()) return {};  // no memory
    copy.SetApp(args.GetApp());
    symbol->Call(object, copy, false);
    return copy.TakeResult();
}

bool ScriptVal::AsyncCallMemberA(AsyncCallback callback, void* context, const char* name,
                                 ScriptArgs& args) {
    if (!IsRemoteObject()) return false;
    ScriptVal key(name);
    ScriptVal held(*this);
    return !key.IsNil() && args.SetPosition(0, key) &&
           g_ScriptHooks.m_DoCommandAsync(held.ToRemoteObject(), SST_CallMemberFunction, args,
                                          callback, context);
}

ScriptVal ScriptVal::DoAction(const char* action, const ScriptVal& args) {
    return CallMember("DoAction", action, args);
}

bool ScriptVal::QueueAction(const char* action, const ScriptVal& args) {
    CallMember("QueueAction", action, args);
    return true;
}

ScriptVal& ScriptArgs::Return() {
    if (!IsArgs()) return InvalidValue();
    uint8_t count = ++m_Value.m_Args.m_NumReturns;
    return FindKey(-int{count}, SVF_Int, SVF_Int);
}

void ScriptArgs::ReturnCode(const void* code, uint32_t size, uint32_t args) {
    Return() = ScriptVal(code, size, args);
}

void ScriptArgs::ReturnFunction(ScriptSymbol* symbol) {
    uint64_t function = reinterpret_cast<uint64_t>(symbol);
    Return().Set(SV_Function, &function);
}

ScriptVal ScriptArgs::TakeResult() {
    if (!IsArgs()) return {};
    TableEntry* entry = Chain::FindNumber(*this, -1);
    if (!entry) return {};
    // An object may be dead by now: then its copy is a nil, which the value itself is not.
    if (entry->m_Value.IsLocalObject(true)) return entry->m_Value;
    ScriptVal result = std::move(entry->m_Value);
    result.m_Flags &= ~SVF_ReadOnly;
    return result;
}

bool ScriptArgs::SetPosition(int position, const ScriptVal& value) {
    if (!IsArgs() || IsReadOnly()) return false;
    TableEntry* entry = Chain::Obtain(*this, position, SVF_Int, SVF_Int);
    if (!entry || entry->m_Value.IsReadOnly()) return false;
    entry->m_Value = value;
    return !IsLostCopy(entry->m_Value, value);
}

bool ScriptArgs::SetArguments(const ScriptVal* const* values, int count) {
    if (Chain::Head(*this)) {  // the values may be among those that are replaced
        ScriptArgs fresh;
        if (!fresh.SetArguments(values, count)) return false;
        for (int i = 1; i <= count; i++) {
            if (!SetPosition(i, fresh[i])) return false;
        }
        return true;
    }
    // From the last to the first, so that each goes before the first entry there is.
    for (int i = count; i > 0; i--) {
        if (!SetPosition(i, *values[i - 1])) return false;
    }
    return true;
}

ScriptArgs* ScriptArgs::DeferReply() {
    bool hasCaller = IsArgs() && GetApp() && m_Value.m_Args.m_Context != 0;
    if (!hasCaller || (m_Flags & SVF_ReplyDeferred)) return nullptr;
    auto* later = new ScriptArgs();
    if (!later) return nullptr;
    later->m_Flags = m_Flags & ~SVF_ReadOnly;
    later->m_Value.m_Args = m_Value.m_Args;
    g_ScriptHooks.m_UseApp(m_Value.m_Args.m_App);
    m_Value.m_Args.m_Table = nullptr;
    m_Flags |= SVF_ReplyDeferred;
    return later;
}

bool ScriptArgs::SendReply() {
    return IsArgs() && GetApp() && g_ScriptHooks.m_SendReply(*this);
}

}  // namespace Korvel

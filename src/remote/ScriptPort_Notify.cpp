// What a process tells others without waiting for an answer.
#include "core/TagList.h"
#include "objects/ScriptSymbol.h"
#include "remote/RemoteObject.h"
#include "remote/ScriptPort.h"

namespace Korvel {
namespace {

void SendTo(const ScriptVal& target, ScriptArgs& args, const RemoteApp* exclude) {
    if (!target.IsRemoteObject() || (exclude && target.GetApp() == exclude)) return;
    ScriptVal held = target;  // the proxy stays while it is used
    held.ToRemoteObject()->DoCommandAsync(SST_CallMemberFunction, args, nullptr, nullptr);
}

}  // namespace

void SendNotify(const ScriptVal& target, ScriptArgs& args, RemoteApp* exclude) {
    if (!target.IsTable()) return SendTo(target, args, nullptr);
    for (TableEntry* entry = nullptr; target.NextKey(entry);) {
        SendTo(entry->m_Value, args, exclude);
    }
}

void SendNotifyExclude(RemoteApp* exclude, const ScriptVal& target, const char* name,
                       ScriptObject* object, const ScriptVal& v1, const ScriptVal& v2,
                       const ScriptVal& v3, const ScriptVal& v4, const ScriptVal& v5,
                       const ScriptVal& v6, const ScriptVal& v7, const ScriptVal& v8, TagList*) {
    ScriptArgs args;
    args[0] = name;
    args[1] = object;
    int key = 2;
    for (const ScriptVal* value : {&v1, &v2, &v3, &v4, &v5, &v6, &v7, &v8}) args[key++] = *value;
    SendNotify(target, args, exclude);
}

void SendNotify(const ScriptVal& target, const char* name, ScriptObject* object,
                const ScriptVal& v1, const ScriptVal& v2, const ScriptVal& v3, const ScriptVal& v4,
                const ScriptVal& v5, const ScriptVal& v6, const ScriptVal& v7, const ScriptVal& v8,
                TagList* tags) {
    SendNotifyExclude(nullptr, target, name, object, v1, v2, v3, v4, v5, v6, v7, v8, tags);
}

bool NotifyHosts(const OxID& name, ScriptVal args, bool includeSelf) {
    GetServer().AsyncCallMember(nullptr, nullptr, "NotifyHosts", name, args, includeSelf);
    return true;
}

}  // namespace Korvel

#pragma once

#include <cmath>
#include <cstdint>
#include <cstdio>
#include <functional>
#include <initializer_list>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "core/ScriptHooksInternal.h"
#include "core/ScriptVal.h"
#include "objects/ScriptObject.h"
#include "remote/RemoteApp.h"

namespace Korvel::Test {

// An object of a host that counts who holds it and tells of every release.
class FakeObject : public ScriptObject {
public:
    FakeObject() = default;
    explicit FakeObject(std::function<void()> onRelease) : m_OnRelease(std::move(onRelease)) {}

    void IncRef() override { m_Uses++; }
    void DecRef() override {
        m_Uses--;
        if (m_OnRelease) m_OnRelease();
    }
    ScriptInfo* GetScriptInfo() const override { return nullptr; }
    void SetScriptInfo(ScriptInfo*) override {}

    int m_Uses = 0;
    std::function<void()> m_OnRelease;
};

// Stands in for the connections while it lives: counts the uses of connections and proxies, notes
// the last command and answers it.
class FakeWire {
public:
    FakeWire() : m_Saved(g_ScriptHooks) {
        s_Wire = this;
        g_ScriptHooks.m_UseApp = [](RemoteApp* app) { s_Wire->m_Uses[app]++; };
        g_ScriptHooks.m_RecycleApp = [](RemoteApp* app) { s_Wire->m_Uses[app]--; };
        g_ScriptHooks.m_IsConnected = [](RemoteApp* app) { return app == s_Wire->App(0); };
        g_ScriptHooks.m_IncRemoteRef = [](RemoteObject* proxy) { s_Wire->Count(proxy, 1); };
        g_ScriptHooks.m_DecRemoteRef = [](RemoteObject* proxy) { s_Wire->Count(proxy, -1); };
        g_ScriptHooks.m_GetRemoteApp = [](RemoteObject*) { return s_Wire->App(0); };
        g_ScriptHooks.m_GetLocalPointer = [](RemoteObject* proxy) {
            return proxy == s_Wire->Proxy(1) ? s_Wire->m_Local : nullptr;
        };
        // Proxies 2 and 3 stand for the same object.
        g_ScriptHooks.m_IsSameRemote = [](RemoteObject* a, RemoteObject* b) {
            return a == b || (a >= s_Wire->Proxy(2) && b >= s_Wire->Proxy(2));
        };
        g_ScriptHooks.m_DoCommand = [](RemoteObject*, int opcode, ScriptArgs& args,
                                       ScriptVal& reply) {
            reply = s_Wire->m_Reply;
            return s_Wire->Send(opcode, args);
        };
        g_ScriptHooks.m_DoCommandAsync = [](RemoteObject*, int opcode, ScriptArgs& args,
                                            AsyncCallback callback, void* context) {
            return s_Wire->Send(opcode, args) && callback(context, nullptr, nullptr, 1);
        };
        g_ScriptHooks.m_SendReply = [](ScriptArgs& args) { return s_Wire->Send(0, args); };
    }
    FakeWire(const FakeWire&) = delete;
    FakeWire& operator=(const FakeWire&) = delete;
    ~FakeWire() { g_ScriptHooks = m_Saved; }

    // Addresses that nobody looks behind.
    RemoteApp* App(int i) { return reinterpret_cast<RemoteApp*>(m_Places + i); }
    RemoteObject* Proxy(int i) { return reinterpret_cast<RemoteObject*>(m_Places + 8 + i); }
    ScriptVal ProxyValue(int i) {
        RemoteObject* proxy = Proxy(i);
        return ScriptVal(SV_RemoteObject, &proxy);
    }

    std::map<void*, int> m_Uses;
    int m_Traffic = 0;  // changes of the uses of proxies
    ScriptObject* m_Local = nullptr;
    bool m_Answers = true;
    ScriptArgs m_Reply;
    int m_Opcode = 0;
    ScriptVal m_Sent;

private:
    void Count(RemoteObject* proxy, int uses) {
        m_Uses[proxy] += uses;
        m_Traffic++;
    }
    bool Send(int opcode, const ScriptArgs& args) {
        m_Opcode = opcode;
        m_Sent = args;
        return m_Answers;
    }

    static inline FakeWire* s_Wire = nullptr;

    ScriptHooks m_Saved;
    uint64_t m_Places[16] = {};
};

inline ScriptVal MakeTable(std::initializer_list<std::pair<ScriptVal, ScriptVal>> entries = {}) {
    ScriptVal table(SV_Table, nullptr);
    for (const auto& [key, value] : entries) table.FindKey(key) = value;
    return table;
}

// All that a value holds, in the order of its chains: entries with nil too, and with `withFlags`
// all flags.
inline std::string Describe(const ScriptVal& value, bool withFlags = true) {
    char text[64] = "";
    if (withFlags) snprintf(text, sizeof(text), "%x:", value.m_Flags);
    std::string out(text);
    MemBlock block = value.ToMemBlock();
    switch (value.Type()) {
        case SV_Nil:
            return out + "nil";
        case SV_Number:
            snprintf(text, sizeof(text), "%.17g", value.ToNumber());
            return out + text;
        case SV_String:
            return out + "'" + value.ToString() + "'";
        case SV_Boolean:
            return out + (value.ToBoolean() ? "true" : "false");
        case SV_Table:
        case SV_Args:
            if (value.GetConstructor()) out += value.GetConstructor();
            out += "{";
            for (const TableEntry* e = value.m_Value.m_Table.m_Table; e; e = e->m_Next) {
                out += Describe(e->m_Key, withFlags) + "=" + Describe(e->m_Value, withFlags);
                if (e->m_Next) out += " ";
            }
            return out + "}";
        case SV_Code:
            block = MemBlock(const_cast<void*>(value.ToCodePtr()), value.ToCodeLen());
            [[fallthrough]];
        case SV_MemBlock:
            return out + "[" + std::string(static_cast<const char*>(block.m_Ptr), block.m_Size) +
                   "]";
        default:
            snprintf(text, sizeof(text), "%llx", (unsigned long long)value.m_Value.m_Pointer);
            return out + text;
    }
}

inline std::string Shape(const ScriptVal& value) {
    return Describe(value, false);
}

}  // namespace Korvel::Test

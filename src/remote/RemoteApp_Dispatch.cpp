// What a connection does with the packets that arrive.
#include <memory>
#include <utility>

#include "Platform/NoKillInternal.h"
#include "core/ScriptHooksInternal.h"
#include "core/ScriptValInternal.h"
#include "objects/ScriptConfig.h"
#include "objects/ScriptObject.h"
#include "objects/ScriptSymbol.h"
#include "remote/RemoteApp.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr uint32_t kMostForUI = 65536;
constexpr uint64_t kMostBytesForUI = uint64_t{64} << 20;

void Reply(RemoteApp* app, Packet* request, const ScriptVal* second = nullptr,
           uint32_t target = 0) {
    Packet* reply = CreateReply(request, app, nullptr, second);
    if (!reply) {
        ScriptVal error(SV_Table, nullptr);
        error.SetError(SCERR_Unknown, "Packet too large.");
        reply = CreateReply(request, app, nullptr, &error);
    }
    if (!reply) return;
    reply->m_Target = target;
    app->SendPkt(reply);
}

void ReplyError(RemoteApp* app, Packet* request, ScriptError code, const char* text = nullptr) {
    ScriptVal error(SV_Table, nullptr);
    error.SetError(code, text);
    Reply(app, request, &error);
}

// Takes out what members alone set.
void UnlinkReserved(ScriptArgs& args) {
    TableEntry* taken = nullptr;
    for (TableEntry** link = &args.m_Value.m_Args.m_Table; TableEntry* entry = *link;) {
        const ScriptVal& key = entry->m_Key;
        if (key == "__delay" || key == "Error" || key == "ErrorString") {
            *link = entry->m_Next;
            entry->m_Next = std::exchange(taken, entry);
        } else {
            link = &entry->m_Next;
        }
    }
    ReleaseChain(taken);
}

constexpr char kNoValues[] = "the peer sent a packet with no valid values";

}  // namespace

// Runs what a PKT_Script asks for.
void RemoteApp::CallMember(Packet* packet) {
    if (!packet->m_Target || !packet->m_Symbol) {
        ReplyError(this, packet, SCERR_Unknown, "No object/symbol id specified.");
        return DropValues(this, packet);
    }
    ScriptArgs args;
    args.m_Value.m_Args.m_Context = packet->m_Context;
    if (!ScriptVal::FromPacket(this, packet, nullptr, &args)) return Close(kNoValues);
    if (!args.IsArgs()) return ReplyError(this, packet, SCERR_InvalidArgs);
    UnlinkReserved(args);
    args.SetApp(this);
    ScriptObject* object = HoldLocalObject(packet->m_Target);
    ScriptInfo* info = object ? object->GetScriptInfo() : nullptr;
    ScriptSymbol* symbol = info ? info->FindSymbol(nullptr, packet->m_Symbol) : nullptr;
    if (!info) {
        ReplyError(this, packet, SCERR_InvalidRemoteObject);
    } else if (!symbol) {
        ReplyError(this, packet, SCERR_UnknownSymbol);
    } else {
        symbol->Call(object, args, false);
        if (!(args.m_Flags & SVF_ReplyDeferred) && !args.SendReply()) {
            ReplyError(this, packet, SCERR_Unknown, "Packet too large.");
        }
    }
    if (object) object->DecRef();
}

void RemoteApp::HandleScriptPacket(Packet* packet) {
    if (!g_ScriptConfig.load(std::memory_order_acquire)) {
        ReplyError(this, packet, SCERR_NotInitialized);
        DropValues(this, packet);
    } else if (packet->m_Type == PKT_Script) {
        CallMember(packet);
    } else if (DropLocalRefs(packet->m_Target)) {
        Reply(this, packet);
    } else {
        ReplyError(this, packet, SCERR_InvalidObject, "Cannot find object for PKT_NoMoreRefs.");
    }
}

void RemoteApp::DispatchPacket(Packet* packet) {
    if ((m_Flags | packet->m_Flags) & PKF_Trace) DumpPacket(packet, this, "Recv");
    if (packet->m_Type == PKT_Reply) {
        HandleReply(packet);
    } else {
        HandleRequest(packet);
    }
}

void RemoteApp::HandleReply(Packet* reply) {
    Request* async = nullptr;
    {
        Platform::NoKill noKill;
        KorvelScript::AutoLock guard(m_Lock);
        Request* request = m_Traffic->m_Requests.Find(reply->m_Context);
        if (request && request->m_IsAsync) {
            m_Traffic->m_Requests.Remove(request);
            async = request;
        } else if (request && !request->m_IsOver) {
            request->m_Reply = std::exchange(reply, nullptr);
            request->m_IsOver = true;
            // Its waiter may end it as soon as the lock is free.
            if (request->m_HasWaiter) request->m_Event.Signal();
        }
    }
    if (async) {
        bool isTaken =
            async->m_Callback && async->m_Callback(async->m_Data, this, reply, async->m_Context);
        if (isTaken) reply = nullptr;
        if (!async->m_Callback || isTaken) {
            delete async;
        } else {  // it stays until somebody asks for it
            KorvelScript::AutoLock guard(m_Lock);
            async->m_IsAsync = false;
            async->m_IsOver = true;
            async->m_Reply = std::exchange(reply, nullptr);
            m_Traffic->m_Requests.Add(async);
        }
    }
    if (reply) DropPkt(this, reply);
}

void RemoteApp::HandleRequest(Packet* packet) {
    {
        KorvelScript::AutoLock guard(m_Lock);
        m_Traffic->m_NumUnanswered++;
    }
    switch (packet->m_Type) {
        case PKT_Script:
            if (PassToUI(packet)) return;
            HandleScriptPacket(packet);
            break;
        case PKT_NoMoreRefs:
            HandleScriptPacket(packet);
            break;
        case PKT_IncRef:
        case PKT_DecRef:
            CountReference(packet);
            break;
        case PKT_GetObjectInfo:
            GetInfo(packet);
            break;
        case PKT_LocalToRemote: {
            RemoteObject* record =
                ExportAddress(packet->m_Symbol | static_cast<uint64_t>(packet->m_Target) << 32);
            Reply(this, packet, nullptr, record ? record->m_ID : 0);
            break;
        }
        case PKT_SetStateData:
            TakeStateData(packet);
            break;
        default:
            ReplyError(this, packet, SCERR_UnknownPacket);
            break;
    }
    FreePkt(packet);
}

void RemoteApp::CountReference(Packet* packet) {
    if (ScriptObject* object = HoldLocalObject(packet->m_Target)) {
        if (packet->m_Type == PKT_IncRef) {
            _IncLocalRef(object);
        } else {
            _DecLocalRef(object);
        }
        object->DecRef();
    }
    Reply(this, packet);
}

void RemoteApp::GetInfo(Packet* packet) {
    ScriptVal query;
    if (!ScriptVal::FromPacket(this, packet, nullptr, &query)) return Close(kNoValues);
    ScriptObject* object = HoldLocalObject(packet->m_Target);
    if (!object) return Reply(this, packet);
    ScriptVal result(SV_Table, nullptr);
    object->GetObjectInfo(query, result);
    object->DecRef();
    Reply(this, packet, &result);
}

void RemoteApp::TakeStateData(Packet* packet) {
    ScriptVal data;
    if (!ScriptVal::FromPacket(this, packet, nullptr, &data)) return Close(kNoValues);
    {
        KorvelScript::AutoLock guard(m_Lock);
        std::swap(m_StateData, data);
    }
    Reply(this, packet);
}

// Leaves a call to the UI thread, where the host has one, but for the two that find out by
// themselves whether they have to go there. True when the packet has been taken over.
bool RemoteApp::PassToUI(Packet* packet) {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    bool isForUI = config && config->m_Active && config->UIExecute &&
                   packet->m_Symbol != SST_GetTable && packet->m_Symbol != SST_CallFunction;
    if (!isForUI) return false;
    Traffic& traffic = *m_Traffic;
    uint32_t count = ++traffic.m_NumForUI;
    uint64_t bytes = traffic.m_BytesForUI += packet->m_Size;
    if (count <= kMostForUI && bytes <= kMostBytesForUI) {
        Use();
        config->UIExecute(DoPacket, this, packet, false);
        return true;
    }
    traffic.m_NumForUI--;
    traffic.m_BytesForUI -= packet->m_Size;
    ReplyError(this, packet, SCERR_Unknown, "Too many unanswered requests.");
    DropPkt(this, packet);
    return true;
}

// On the UI thread.
unsigned long long RemoteApp::DoPacket(void* appPointer, void* packetPointer) {
    auto* app = static_cast<RemoteApp*>(appPointer);
    auto* packet = static_cast<Packet*>(packetPointer);
    app->m_Traffic->m_NumForUI--;
    app->m_Traffic->m_BytesForUI -= packet->m_Size;
    app->HandleScriptPacket(packet);
    FreePkt(packet);
    app->Recycle();
    return 0;
}

}  // namespace Korvel

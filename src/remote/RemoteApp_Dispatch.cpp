// What a connection does with the packets that arrive.
#include <cstring>
#include <utility>

#include "core/ScriptValInternal.h"
#include "objects/ScriptConfig.h"
#include "objects/ScriptObject.h"
#include "objects/ScriptSymbol.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptPortInternal.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

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

// Whether there may be an object of ours in a packet: false is sure.
bool MayNameOurs(const Packet& packet) {
    return memchr(packet.Payload(), SV_RemoteObject, packet.m_Size - sizeof(Packet));
}

bool HasArguments(const ScriptArgs& args) {
    for (TableEntry* entry = nullptr; args.NextKey(entry);) {
        if (entry->m_Key != 0 && !entry->m_Value.IsNil()) return true;
    }
    return false;
}

// What script servers ask hosts of their own accord. All else is what others have them ask.
bool IsOfServers(uint32_t opcode, const ScriptArgs& args) {
    return opcode == SST_CallMemberFunction && args[0] == "GetPingInfo" && !HasArguments(args);
}

// Whether a call of the application's object is one by which a peer introduces itself or logs in:
// by its name, the look-up of that, or what the look-up gives.
bool IsOfStrangers(uint32_t opcode, const ScriptArgs& args) {
    const ScriptVal& key = args[0];
    switch (opcode) {
        case SST_GetTable:
        case SST_CallMemberFunction:
            return IsHostMember(key.ToString(""));
        case SST_CallFunction:
            return key.IsFunction() && IsHostMember(key.ToFunction());
        default:
            return false;
    }
}

}  // namespace

bool RemoteApp::IsLoggedIn() const {
    return m_Traffic->m_IsLoggedIn;
}

void RemoteApp::SetLoggedIn(uint16_t run) {
    AutoAppLock guard(m_Lock);
    if (m_Traffic->m_Run == run) m_Traffic->m_IsLoggedIn = true;
}

void RemoteApp::Reply(Packet* request, const ScriptVal* second, uint32_t target) {
    auto run = static_cast<uint16_t>(request->m_Reserved);
    Packet* reply = CreateReplyOrError(request->m_Context, this, run, nullptr, second);
    if (!reply) return Close(kNoMemoryForReply, request->m_Reserved);
    reply->m_Target = target;
    SendPkt(reply);
}

void RemoteApp::ReplyError(Packet* request, ScriptError code, const char* text) {
    ScriptVal error(SV_Table, nullptr);
    error.SetError(code, text);
    Reply(request, &error);
}

// Whether the peer may use what it has been given: it has logged in, or this process has called it.
bool RemoteApp::MayUseGiven() const {
    return m_Traffic->m_IsLoggedIn || m_Traffic->m_PeerKind == PeerKind::Host;
}

// The same for the object with a number: the application's own is not given, but there for all.
bool RemoteApp::MayUse(uint32_t target) const {
    return m_Traffic->m_IsLoggedIn || (target != kRootID && MayUseGiven());
}

// Whether the peer may make a call of the application's object although it may not use that.
bool RemoteApp::IsOpenToAll(uint32_t opcode, const ScriptArgs& args) const {
    return IsOfStrangers(opcode, args) ||
           (m_Traffic->m_PeerKind == PeerKind::Server && IsOfServers(opcode, args));
}

// True, with the request answered, when the peer may not ask for such a thing: it has not logged
// in.
bool RemoteApp::RefuseStranger(Packet* packet, bool isKnown) {
    if (isKnown) return false;
    ReplyError(packet, SCERR_NotLoggedIn);
    Drop(packet);
    return true;
}

// Runs what a PKT_Script asks for.
void RemoteApp::CallMember(Packet* packet) {
    if (RefuseStranger(packet, packet->m_Target == kRootID || MayUse(packet->m_Target))) return;
    if (!packet->m_Target || !packet->m_Symbol) {
        ReplyError(packet, SCERR_Unknown, "No object/symbol id specified.");
        return Drop(packet);
    }
    ScriptObject* object = HoldLocalObject(packet->m_Target);
    ScriptInfo* info = object ? object->GetScriptInfo() : nullptr;
    if (info) {
        CallMember(packet, object, info);
    } else {
        ReplyError(packet, SCERR_InvalidRemoteObject);
        Drop(packet);
    }
    if (object) object->DecRef();
}

void RemoteApp::CallMember(Packet* packet, ScriptObject* object, ScriptInfo* info) {
    uint16_t run = static_cast<uint16_t>(packet->m_Reserved);
    ScriptArgs args;
    if (!ScriptVal::FromPacket(this, packet, nullptr, &args)) return Close(kNoValues, run);
    bool isKnown =
        MayUse(packet->m_Target) || (args.IsArgs() && IsOpenToAll(packet->m_Symbol, args));
    if (!isKnown) return ReplyError(packet, SCERR_NotLoggedIn);
    if (!args.IsArgs()) return ReplyError(packet, SCERR_InvalidArgs);
    UnlinkReserved(args);
    args.SetApp(this);
    args.m_Value.m_Args.m_Context = packet->m_Context;
    args.m_Value.m_Args.m_Run = run;
    if ((m_Flags | packet->m_Flags) & PKF_Trace) TraceValues("->", packet->m_Context, args);
    bool isKind = packet->m_Symbol < SST_EndOpcode;
    ScriptSymbol* symbol = isKind ? info->FindSymbol(nullptr, packet->m_Symbol) : nullptr;
    if (!symbol) return ReplyError(packet, SCERR_UnknownSymbol);
    symbol->Call(object, args, false);
    bool isDeferred = args.m_Flags & SVF_ReplyDeferred;
    if (!isDeferred && !args.SendReply()) Close(kNoMemoryForReply, run);
}

// Lets the values of a packet go that nobody opens.
void RemoteApp::Drop(Packet* packet) {
    if (!DropValues(this, packet)) Close(kNoValues, packet->m_Reserved);
}

void RemoteApp::HandleScriptPacket(Packet* packet) {
    if (!g_ScriptConfig.load(std::memory_order_acquire) || m_Traffic->m_IsRefused) {
        ReplyError(packet, SCERR_NotInitialized);
    } else if (packet->m_Type == PKT_Script) {
        return CallMember(packet);
    } else if (packet->m_Type == PKT_DecRef) {
        CountReference(packet);
    } else if (DropLocalRefs(packet->m_Target)) {
        Reply(packet);
    } else {
        ReplyError(packet, SCERR_InvalidObject, "Cannot find object for PKT_NoMoreRefs.");
    }
    Drop(packet);
}

void RemoteApp::DispatchPacket(Packet* packet) {
    packet->m_Reserved = m_Traffic->m_Run;  // which does not change while its thread runs
    if ((m_Flags | packet->m_Flags) & PKF_Trace) DumpPacket(packet, this, "Recv");
    if (packet->m_Type == PKT_Reply) {
        HandleReply(packet);
    } else {
        HandleRequest(packet);
    }
}

// The peer may let go of an object of ours right behind the reply that names it. So the values are
// read before the next packet is served, and not when the waiter comes to it.
bool RemoteApp::OpenReply(Packet* reply) {
    {
        AutoAppLock guard(m_Lock);
        Request* request = m_Traffic->m_Requests.Find(reply->m_Context);
        if (!request || !request->m_WantsValues) return false;
    }
    if (!MayNameOurs(*reply)) return false;
    ScriptVal values;
    if (!ScriptVal::FromPacket(this, reply, nullptr, &values)) Close(kNoValues);
    const Waiter* asleep = nullptr;
    {
        AutoAppLock guard(m_Lock);
        Request* request = m_Traffic->m_Requests.Find(reply->m_Context);
        if (request && !request->m_Waiter.IsOver() && !m_Traffic->m_WhyClosed) {
            request->m_Values = std::move(values);
            request->m_HasValues = true;
            if (request->m_Waiter.EndQuietly()) asleep = &request->m_Waiter;
        }
    }
    if (asleep) Waiter::WakeUp(asleep);
    return true;
}

void RemoteApp::HandleReply(Packet* reply) {
    if (OpenReply(reply)) return FreePkt(reply);
    Request* async = nullptr;
    const Waiter* asleep = nullptr;
    {
        AutoAppLock guard(m_Lock);
        Traffic& traffic = *m_Traffic;
        Request* request = traffic.m_Requests.Find(reply->m_Context);
        if (!request && traffic.m_NumSilent) traffic.m_NumSilent--;
        if (request && request->m_IsAsync) {
            traffic.m_Requests.Remove(request);
            async = request;
        } else if (request && !request->m_Waiter.IsOver()) {
            // From here on its waiter may end it.
            request->m_Reply = std::exchange(reply, nullptr);
            if (request->m_Waiter.EndQuietly()) asleep = &request->m_Waiter;
        }
    }
    if (asleep) Waiter::WakeUp(asleep);
    if (!reply) return;
    if (!async) {  // nobody asks for it any more
        Drop(reply);
        return FreePkt(reply);
    }
    if (async->m_Callback(async->m_Data, this, reply, async->m_Context)) {
        delete async;
        return;
    }
    // It stays until somebody asks for it.
    async->m_IsAsync = false;
    async->m_Callback = nullptr;
    async->m_DeadlineNs = 0;
    async->m_Reply = reply;
    async->m_Waiter.End();
    AutoAppLock guard(m_Lock);
    m_Traffic->m_Requests.Add(async);
}

void RemoteApp::HandleRequest(Packet* packet) {
    if (m_Traffic->m_IsRefused) {
        Drop(packet);
        return FreePkt(packet);
    }
    {
        AutoAppLock guard(m_Lock);
        m_Traffic->m_NumUnanswered++;
    }
    switch (packet->m_Type) {
        case PKT_Script:
        case PKT_NoMoreRefs:
        case PKT_DecRef:
            if (PassToUI(packet)) return;
            HandleScriptPacket(packet);
            break;
        case PKT_IncRef:
            CountReference(packet);
            Drop(packet);
            break;
        case PKT_GetObjectInfo:
            if (!RefuseStranger(packet, MayUse(packet->m_Target))) GetInfo(packet);
            break;
        case PKT_LocalToRemote:
            if (RefuseStranger(packet, m_Traffic->m_IsLoggedIn)) break;
            Reply(packet, nullptr,
                  ExportAddress(packet->m_Symbol | static_cast<uint64_t>(packet->m_Target) << 32));
            Drop(packet);
            break;
        case PKT_SetStateData:
            if (!RefuseStranger(packet, MayUseGiven())) TakeStateData(packet);
            break;
        default:
            ReplyError(packet, SCERR_UnknownPacket);
            DropValues(this, packet);  // whether or not they are valid
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
    Reply(packet);
}

void RemoteApp::GetInfo(Packet* packet) {
    ScriptVal query;
    if (!ScriptVal::FromPacket(this, packet, nullptr, &query)) return Close(kNoValues);
    ScriptObject* object = HoldLocalObject(packet->m_Target);
    if (!object) return Reply(packet);
    ScriptVal result(SV_Table, nullptr);
    object->GetObjectInfo(query, result);
    object->DecRef();
    Reply(packet, &result);
}

void RemoteApp::TakeStateData(Packet* packet) {
    ScriptVal data;
    if (!ScriptVal::FromPacket(this, packet, nullptr, &data)) return Close(kNoValues);
    {
        AutoAppLock guard(m_Lock);
        std::swap(m_StateData, data);
    }
    Reply(packet);
}

// Leaves a call to the UI thread, where the host has one, but for the two that find out by
// themselves whether they have to go there; and a release, which must not overtake a call. True
// when the packet has been taken over.
bool RemoteApp::PassToUI(Packet* packet) {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    if (!config || !config->m_Active || !config->UIExecute) return false;
    bool isCall = packet->m_Type == PKT_Script;
    if (isCall && (packet->m_Symbol == SST_GetTable || packet->m_Symbol == SST_CallFunction)) {
        return false;
    }
    Traffic& traffic = *m_Traffic;
    if (!(isCall ? traffic.m_CallsForUI : traffic.m_ReleasesForUI).Add(packet->m_Size)) {
        if (!isCall) return false;  // a release is served in any case
        ReplyError(packet, SCERR_Unknown, "Too many unanswered requests.");
        Drop(packet);
        FreePkt(packet);
        return true;
    }
    Use();
    config->UIExecute(DoPacket, this, packet, false);
    return true;
}

// On the UI thread.
unsigned long long RemoteApp::DoPacket(void* appPointer, void* packetPointer) {
    auto* app = static_cast<RemoteApp*>(appPointer);
    auto* packet = static_cast<Packet*>(packetPointer);
    Traffic& traffic = *app->m_Traffic;
    bool isCall = packet->m_Type == PKT_Script;
    (isCall ? traffic.m_CallsForUI : traffic.m_ReleasesForUI).Remove(packet->m_Size);
    // What the packet names has gone with its run.
    if (app->GetRun() == packet->m_Reserved) app->HandleScriptPacket(packet);
    FreePkt(packet);
    app->Recycle();
    return 0;
}

}  // namespace Korvel

#include "remote/Packets.h"

#include <algorithm>
#include <cstdio>
#include <iterator>

#include "Platform/NoKillInternal.h"
#include "core/ScriptVal.h"
#include "diag/Env.h"
#include "objects/ScriptSymbol.h"
#include "remote/RemoteApp.h"

namespace Korvel {
namespace {

EnvInt s_MaxPacketSize("KORVEL_MaxPacketSize", true, 256);

const char* const s_PktType[] = {
    "PKT_DoNothing",         "PKT_Script",        "PKT_IncRef",       "PKT_DecRef",
    "PKT_NoMoreRefs",        "PKT_GetObjectInfo", "PKT_ScriptEvent",  "PKT_ScriptEventAdd",
    "PKT_ScriptEventRemove", "PKT_LocalToRemote", "PKT_SetStateData",
};

const char* TypeName(uint32_t type) {
    if (type == PKT_Reply) return "PKT_Reply";
    return type < std::size(s_PktType) ? s_PktType[type] : "PKT_?????";
}

}  // namespace

uint32_t GetMaxPacketSize() {
    return static_cast<uint32_t>(std::clamp<int64_t>(s_MaxPacketSize, 1, 2047)) << 20;
}

Packet* AllocPkt(unsigned long size) {
    return static_cast<Packet*>(g_ReusePoolMgr.Alloc(size));
}

void FreePkt(Packet* packet) {
    g_ReusePoolMgr.Free(packet);
}

void DropValues(RemoteApp* app, Packet* packet) {
    unsigned char* cursor = packet->Payload();
    for (int i = 0; i < 2; i++) {
        ScriptVal value;
        if (!value.FromPkt(app, cursor, packet->End())) return;
    }
}

void DropPkt(RemoteApp* app, Packet* packet) {
    if (packet) DropValues(app, packet);
    FreePkt(packet);
}

Packet* CreatePkt(uint32_t type, RemoteApp* app, const ScriptVal* first, const ScriptVal* second) {
    if (!first) first = &ScriptVal::nil;
    if (!second) second = &ScriptVal::nil;
    uint32_t firstSize = first->CalcPktSize();
    uint32_t secondSize = second->CalcPktSize();
    uint64_t size = sizeof(Packet) + uint64_t{firstSize} + secondSize;
    if (firstSize == 0 || secondSize == 0 || size > GetMaxPacketSize()) return nullptr;
    Packet* packet = AllocPkt(size);
    if (!packet) return nullptr;
    *packet = {};
    packet->m_Size = static_cast<uint32_t>(size);
    packet->m_Type = type;
    if (app) packet->m_Flags = app->GetFlags() & PKF_Trace;
    unsigned char* cursor = packet->Payload();
    first->ToPkt(app, cursor);
    second->ToPkt(app, cursor);
    return packet;
}

Packet* CreateReply(uint32_t context, RemoteApp* app, const ScriptVal* first,
                    const ScriptVal* second) {
    Packet* reply = CreatePkt(PKT_Reply, app, first, second);
    if (reply) reply->m_Context = context;
    return reply;
}

Packet* CreateReply(Packet* request, RemoteApp* app, const ScriptVal* first,
                    const ScriptVal* second) {
    return CreateReply(request->m_Context, app, first, second);
}

void DumpPacket(const Packet* packet, const RemoteApp* app, const char* direction) {
    Platform::NoKill noKill;
    uint32_t opcode = packet->m_Symbol - SST_FirstOpcode;
    bool hasOpcode = packet->m_Type == PKT_Script && opcode < std::size(SSTName);
    printf("App %p: %s ctx=%u tgt=%u %s %s%s\n", static_cast<const void*>(app), direction,
           packet->m_Context, packet->m_Target, TypeName(packet->m_Type),
           hasOpcode ? SSTName[opcode] : "", hasOpcode ? " " : "");
}

}  // namespace Korvel

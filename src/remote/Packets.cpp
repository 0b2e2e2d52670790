#include "remote/Packets.h"

#include <algorithm>
#include <cstdio>
#include <iterator>
#include <utility>

#include "Platform/NoKillInternal.h"
#include "core/ReusePoolInternal.h"
#include "core/ScriptVal.h"
#include "core/SpinLock.h"
#include "diag/Env.h"
#include "objects/ScriptSymbol.h"
#include "remote/RemoteApp.h"
#include "remote/TrafficInternal.h"

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

// A large block comes fresh from the system each time, and the pages that it makes then cost more
// than the bytes that are copied into them. So some of those that packets leave are kept for the
// next ones.
class SpareBlocks {
public:
    // Null when none fits.
    void* Take(unsigned long size) {
        if (size < kSmallest) return nullptr;
        Hold hold(m_Lock);
        void** best = nullptr;
        for (void*& block : m_Blocks) {
            if (!block || SizeOf(block) < size || SizeOf(block) / kMostWaste > size) continue;
            if (!best || SizeOf(block) < SizeOf(*best)) best = &block;
        }
        if (!best) return nullptr;
        m_Bytes -= SizeOf(*best);
        return std::exchange(*best, nullptr);
    }

    // False when it is for the pools.
    bool Keep(void* block) {
        uint64_t size = SizeOf(block);
        if (size < kSmallest || size > kMostBytes || GetNumConnections() == 0) return false;
        Hold hold(m_Lock);
        void** place = std::find(m_Blocks, std::end(m_Blocks), nullptr);
        if (place == std::end(m_Blocks) || m_Bytes + size > kMostBytes) return false;
        *place = block;
        m_Bytes += size;
        return true;
    }

    void Free() {
        for (void*& place : m_Blocks) {
            void* block;
            {
                Hold hold(m_Lock);
                block = std::exchange(place, nullptr);
                if (block) m_Bytes -= SizeOf(block);
            }
            g_ReusePoolMgr.Free(block);
        }
    }

private:
    static constexpr uint64_t kSmallest = 128 << 10;  // smaller ones the system hands out again
    static constexpr uint64_t kMostBytes = 16 << 20;
    static constexpr int kMostWaste = 4;  // times the size

    static uint64_t SizeOf(void* block) {
        return static_cast<PoolAccess::Block*>(block)[-1].m_Size;
    }

    // Inside of any other lock.
    struct Hold {
        explicit Hold(SpinLock& lock) : m_Lock(lock) {}
        Platform::NoKill m_NoKill;
        AutoSpinLock m_Lock;
    };

    SpinLock m_Lock;
    void* m_Blocks[8] = {};
    uint64_t m_Bytes = 0;
};

constinit SpareBlocks s_SpareBlocks;

}  // namespace

uint32_t GetMaxPacketSize() {
    return static_cast<uint32_t>(std::clamp<int64_t>(s_MaxPacketSize, 1, 2047)) << 20;
}

Packet* AllocPkt(unsigned long size) {
    void* spare = s_SpareBlocks.Take(size);
    return static_cast<Packet*>(spare ? spare : g_ReusePoolMgr.Alloc(size));
}

void FreePkt(Packet* packet) {
    if (packet && !s_SpareBlocks.Keep(packet)) g_ReusePoolMgr.Free(packet);
}

void FreeSparePackets() {
    s_SpareBlocks.Free();
}

bool DropValues(RemoteApp* app, Packet* packet) {
    bool isValid = ScriptVal::FromPacket(app, packet, nullptr, nullptr);
    if (packet->m_Type == PKT_Reply && packet->m_Target && app) {
        if (RemoteObject* proxy = app->IncRemoteRef(packet->m_Target)) proxy->DecRef();
    }
    return isValid;
}

void DropPkt(RemoteApp* app, Packet* packet) {
    if (packet) DropValues(app, packet);
    FreePkt(packet);
}

namespace {

Packet* Create(uint32_t type, RemoteApp* app, uint16_t run, const ScriptVal* first,
               const ScriptVal* second) {
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
    if (app) {
        packet->m_Flags = app->GetFlags() & PKF_Trace;
        packet->m_Reserved = run ? run : app->GetRun();
    }
    WriteValues(packet, app, *first, *second);
    return packet;
}

}  // namespace

Packet* CreatePkt(uint32_t type, RemoteApp* app, const ScriptVal* first, const ScriptVal* second) {
    return Create(type, app, 0, first, second);
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

Packet* CreateReplyOrError(uint32_t context, RemoteApp* app, uint16_t run, const ScriptVal* first,
                           const ScriptVal* second) {
    Packet* reply = Create(PKT_Reply, app, run, first, second);
    if (!reply) {
        ScriptVal error(SV_Table, nullptr);
        error.SetError(SCERR_Unknown, kTooLarge);
        reply = Create(PKT_Reply, app, run, nullptr, &error);
    }
    if (reply) reply->m_Context = context;
    return reply;
}

void DumpPacket(const Packet* packet, const RemoteApp* app, const char* direction) {
    Platform::NoKill noKill;
    uint32_t opcode = packet->m_Symbol - SST_FirstOpcode;
    bool hasOpcode = packet->m_Type == PKT_Script && opcode < std::size(SSTName);
    printf("App %p: %s ctx=%u tgt=%u %s %s%s\n", static_cast<const void*>(app), direction,
           packet->m_Context, packet->m_Target, TypeName(packet->m_Type),
           hasOpcode ? SSTName[opcode] : "", hasOpcode ? " " : "");
}

void TraceValues(const char* arrow, uint32_t context, const ScriptVal& values) {
    OxStringT<char> text;
    if (!values.ToText(text, 0, TXT_Compact | TXT_References)) text = "(no text)";
    Platform::NoKill noKill;
    printf("   %s [%u] %s\n", arrow, context, static_cast<const char*>(text));
}

}  // namespace Korvel

#pragma once

#include <cstddef>
#include <cstdint>

#include "core/Export.h"

namespace Korvel {

class RemoteApp;
class ScriptVal;

// What a packet asks for.
enum : uint32_t {
    PKT_DoNothing,
    PKT_Script,  // calls a member; the symbol is an opcode, or a symbol kind below 128
    PKT_IncRef,
    PKT_DecRef,
    PKT_NoMoreRefs,  // the sender has let go of the object altogether
    PKT_GetObjectInfo,
    PKT_ScriptEvent,  // the three events are not served
    PKT_ScriptEventAdd,
    PKT_ScriptEventRemove,
    PKT_LocalToRemote,  // symbol and target: an address on the receiver
    PKT_SetStateData,
    PKT_Reply = 0xffffffff,
};

constexpr uint32_t PKF_Trace = 0x80000000;  // print this packet and what it causes

// A message of one process to another, as it stands in the stream: a header, then two values, in
// little-endian order without gaps. docs/protocol.md tells the bytes.
//
// Ownership: a packet comes from AllocPkt and belongs to whoever holds it last. Whoever opens it
//            takes over the counts of the objects in it; a packet that nobody opens is let go with
//            DropPkt, so that they go back.
class Packet {
public:
    uint32_t m_Size;  // of the whole packet
    uint32_t m_Type;
    uint32_t m_Symbol;
    uint32_t m_Target;   // the receiver's number of an object
    uint32_t m_Context;  // the sender's number of a request; a reply has that of its request
    uint32_t m_Flags;
    uint32_t m_Delay;     // milliseconds to wait before it is written
    uint32_t m_Reserved;  // 0 on its way; here the run of the connection that it belongs to

    unsigned char* Payload() { return reinterpret_cast<unsigned char*>(this + 1); }
    const unsigned char* Payload() const {
        return reinterpret_cast<const unsigned char*>(this + 1);
    }
    const unsigned char* End() const {
        return reinterpret_cast<const unsigned char*>(this) + m_Size;
    }
};

static_assert(sizeof(Packet) == 32 && offsetof(Packet, m_Context) == 16);

constexpr uint32_t kMinPacketSize = 40;  // a header and two nils

// The bytes that a packet may have at most: KORVEL_MaxPacketSize in MiB, 256 by default and 1 to
// 2047.
KORVEL_EXPORT uint32_t GetMaxPacketSize();

// A block of at least `size` bytes from the pools, with nothing filled in; null without memory.
KORVEL_EXPORT Packet* AllocPkt(unsigned long size);
KORVEL_EXPORT void FreePkt(Packet* packet);

// Gives back the memory that free packets keep for those to come.
KORVEL_EXPORT void FreeSparePackets();

// Reads the values of a packet that has come through `app` and lets them go, because each object in
// it counts for the sender, that in a reply's target too. False when they are none. DropPkt frees
// the packet too: for one that nobody opens.
KORVEL_EXPORT bool DropValues(RemoteApp* app, Packet* packet);
KORVEL_EXPORT void DropPkt(RemoteApp* app, Packet* packet);

// A packet with two values; null stands for a nil. Null when memory has run out, when a value nests
// too deeply, and when the packet would be too large. Objects in it count from here on.
KORVEL_EXPORT Packet* CreatePkt(uint32_t type, RemoteApp* app, const ScriptVal* first,
                                const ScriptVal* second);

// The reply to a request.
KORVEL_EXPORT Packet* CreateReply(uint32_t context, RemoteApp* app, const ScriptVal* first,
                                  const ScriptVal* second);
KORVEL_EXPORT Packet* CreateReply(Packet* request, RemoteApp* app, const ScriptVal* first,
                                  const ScriptVal* second);

// The same, of a run; 0 is the one there is. What is too large, or too deep, becomes an error that
// tells so, since somebody waits for the reply. Null without memory.
Packet* CreateReplyOrError(uint32_t context, RemoteApp* app, uint16_t run, const ScriptVal* first,
                           const ScriptVal* second);

// Fills in the values, for which there is just room, and counts the objects in the packet's run.
void WriteValues(Packet* packet, RemoteApp* app, const ScriptVal& first, const ScriptVal& second);

// Print a line about a packet to standard output, and one about the values in it.
KORVEL_EXPORT void DumpPacket(const Packet* packet, const RemoteApp* app, const char* direction);
void TraceValues(const char* arrow, uint32_t context, const ScriptVal& values);

}  // namespace Korvel

#include "remote/RemoteObject.h"

#include <array>
#include <bit>

#include "objects/ScriptSymbol.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

// Tells in a text from the peer where its object is.
void AppendWhere(const RemoteApp& app, ScriptVal& text) {
    auto address = std::bit_cast<std::array<unsigned char, 4>>(app.GetIPAddress());
    OxStringT<char> whole;
    whole.PrintF("%s [App: '%s' on %u.%u.%u.%u, UUID: %s]", text.ToString("<nil>"),
                 static_cast<const char*>(app.GetName()), address[0], address[1], address[2],
                 address[3], app.GetUUID().ToString("<nil>"));
    text = ScriptVal(whole, whole.GetLength());
}

Packet* CreateCommand(RemoteObject* object, int op, const ScriptArgs& args) {
    if (!object->m_App || object->m_IsLocal) return nullptr;  // the number is the peer's word
    Packet* packet = ScriptVal::ToPacket(object, op, nullptr, &args);
    if (!packet) object->m_App->SetLastError(SCERR_Unknown, kTooLarge);
    return packet;
}

}  // namespace

void RemoteObject::IncRef() {
    if (!m_App) return;
    if (m_IsLocal) {
        m_App->_IncLocalRef(m_Object);
    } else {
        m_App->IncProxy(this);
    }
}

void RemoteObject::DecRef() {
    if (!m_App) return;
    if (m_IsLocal) {
        m_App->_DecLocalRef(m_Object);
    } else {
        m_App->DecProxy(this);
    }
}

ScriptVal RemoteObject::DoCommand(int op, ScriptArgs& args) {
    ScriptVal result;
    DoCommand(op, args, result);
    return result;
}

bool RemoteObject::DoCommand(int op, ScriptArgs& args, ScriptVal& result) {
    // What a packet names is counted from its making on, so none is made that could not be sent.
    if (!m_App || !m_App->MayWait()) return false;
    Packet* packet = CreateCommand(this, op, args);
    if (!packet) return false;
    if (!m_App->Exchange(packet, result)) return false;
    if (op == SST_ToString && result.IsTable()) AppendWhere(*m_App, result[-1]);
    return true;
}

uint32_t RemoteObject::DoCommandAsync(int op, ScriptArgs& args, AsyncCallback callback,
                                      void* data) {
    Packet* packet = CreateCommand(this, op, args);
    if (!packet) return 0;
    uint32_t context = m_App->DoPktAsync(packet, callback, data);
    if (!context) FreePkt(packet);
    return context;
}

}  // namespace Korvel

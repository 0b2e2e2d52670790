#include "remote/RemoteObject.h"

#include <array>
#include <bit>

#include "objects/ScriptSymbol.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"

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
    if (!object->m_App) return nullptr;
    Packet* packet = ScriptVal::ToPacket(object, op, nullptr, &args);
    if (!packet) object->m_App->SetLastError(SCERR_Unknown, "Packet too large.");
    return packet;
}

}  // namespace

void RemoteObject::IncRef() {
    if (!m_App) return;
    if (m_IsLocal) {
        m_App->_IncLocalRef(m_Object);
    } else {
        m_App->IncRemoteRef(m_ID);
    }
}

void RemoteObject::DecRef() {
    if (!m_App) return;
    if (m_IsLocal) {
        m_App->_DecLocalRef(m_Object);
    } else {
        m_App->DecRemoteRef(m_ID);
    }
}

ScriptVal RemoteObject::DoCommand(int op, ScriptArgs& args) {
    ScriptVal result;
    return DoCommand(op, args, result) ? result : ScriptVal();
}

bool RemoteObject::DoCommand(int op, ScriptArgs& args, ScriptVal& result) {
    Packet* packet = CreateCommand(this, op, args);
    if (!packet) return false;
    Packet* reply = m_App->ExchangePkt(packet);
    if (!reply) return false;
    bool isValid = ScriptVal::FromPacket(this, reply, nullptr, &result);
    FreePkt(reply);
    if (!isValid) {
        m_App->Close("the peer sent a reply with no valid values");
        return false;
    }
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

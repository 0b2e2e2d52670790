// Bytes from outside as a value: what is read can be written, and is read again as the same.
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <vector>

#include "remote/Packets.h"
#include "remote/RemoteApp.h"

using namespace Korvel;

namespace {

void Check(bool holds) {
    if (!holds) abort();
}

// Takes every object of the peer.
class FakeApp : public RemoteApp {
public:
    FakeApp() : RemoteApp("fuzz", 0, nullptr) {}
    bool Connected() const override { return true; }
};

// Without the objects: a proxy goes home under a type of its own.
std::vector<unsigned char> Write(const ScriptVal& value) {
    std::vector<unsigned char> bytes(value.CalcPktSize());
    Check(!bytes.empty());
    unsigned char* cursor = bytes.data();
    Check(value.ToPkt(nullptr, cursor) && cursor == bytes.data() + bytes.size());
    return bytes;
}

void CheckValue(RemoteApp& app, const std::vector<unsigned char>& input) {
    std::vector<unsigned char> bytes(input);
    unsigned char* cursor = bytes.data();
    ScriptVal value, again;
    if (!value.FromPkt(&app, cursor, bytes.data() + bytes.size())) {
        Check(value.IsNil() && cursor == bytes.data());
        return;
    }
    // What has been read takes as much as before, but for a reference, which is a nil.
    std::vector<unsigned char> form = Write(value);
    Check(form.size() <= static_cast<size_t>(cursor - bytes.data()));
    cursor = form.data();
    Check(again.FromPkt(nullptr, cursor, form.data() + form.size()));
    Check(cursor == form.data() + form.size());
    // Objects are gone without a connection; from here on all stays.
    form = Write(again);
    cursor = form.data();
    Check(value.FromPkt(nullptr, cursor, form.data() + form.size()) && Write(value) == form);
}

void CheckPacket(RemoteApp& app, const std::vector<unsigned char>& payload, uint32_t type) {
    Packet* packet = AllocPkt(sizeof(Packet) + payload.size());
    *packet = {};
    packet->m_Size = static_cast<uint32_t>(sizeof(Packet) + payload.size());
    packet->m_Type = type;
    std::copy(payload.begin(), payload.end(), packet->Payload());
    ScriptVal first;
    ScriptArgs second;
    ScriptVal::FromPacket(&app, packet, &first, &second);
    DropPkt(&app, packet);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    // Blocks of just the size, so that AddressSanitizer sees the rest.
    FakeApp app;
    std::vector<unsigned char> bytes(data, data + size);
    CheckValue(app, bytes);
    CheckPacket(app, bytes, PKT_Script);
    CheckPacket(app, bytes, PKT_Reply);
    Check(app.GetUseCount() == 1);  // as each proxy has one
    return 0;
}

// Whatever a peer asks of an object by opcode, with whatever arguments, does no harm. The input is
// one command after the other: a byte for the opcode, and the wire form of the arguments.
#include <cstdint>
#include <cstdlib>
#include <vector>

#include "core/RefObject.h"
#include "objects/Publish.h"

namespace {

using namespace Korvel;

class Target : public Scripted<_Object> {
    KORVEL_SCRIPTED(Target)
public:
    Target() { SetScriptClass(); }

private:
    ScriptVal m_Value;
};

KORVEL_PUBLISH(Target, "Target", "A target - to aim at.", "")
KORVEL_FUNCTION(Target, Swap, 0, {SYMT_Usage, "Changes places."}, {SYMT_ArgType, "any"}) {
    args.Return(args[2]);
    args.Return(args[1]);
}
KORVEL_VARIABLE(Target, Value, SSF_Read | SSF_Write, {SYMT_AttrName, "value"}) {
    if (set) {
        self.m_Value = args[1];
    } else {
        args.Return(self.m_Value);
    }
}
KORVEL_OPCODE(Target, SST_GetTableUnknown, 0) {
    if (args[0].IsNumber()) args.Return(args[0]);
}
KORVEL_CREATE(Target, 0) {
    args.ReturnNil();
}
KORVEL_PUBLISHED(Target);

// All that an address from a peer could be of ours.
std::vector<uint64_t> GetAddresses(const ScriptInfo& info) {
    std::vector<uint64_t> addresses;
    for (const ScriptInfo* level = &info; level; level = level->GetParent()) {
        for (ScriptSymbol& symbol : level->GetSymbols()) {
            addresses.push_back(reinterpret_cast<uint64_t>(&symbol));
        }
        for (unsigned opcode = SST_FirstOpcode; opcode < SST_EndOpcode; opcode++) {
            if (ScriptSymbol* symbol = level->GetOpcode(opcode)) {
                addresses.push_back(reinterpret_cast<uint64_t>(symbol));
            }
        }
    }
    return addresses;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    Target target;
    const ScriptInfo& info = *target.GetScriptInfo();
    static const std::vector<uint64_t> addresses = GetAddresses(info);
    std::vector<unsigned char> bytes(data, data + size);
    unsigned char* cursor = bytes.data();
    unsigned char* end = cursor + bytes.size();
    while (cursor != end) {
        unsigned opcode = SST_FirstOpcode + *cursor++ % (SST_EndOpcode - SST_FirstOpcode);
        ScriptVal value;
        if (!value.FromPkt(nullptr, cursor, end) || !value.IsArgs()) break;
        ScriptArgs args;
        args = std::move(value);
        // Small numbers stand for addresses that the fuzzer cannot know.
        uint64_t& function = args[0].m_Value.m_Function;
        if (args[0].IsFunction() && function < addresses.size()) function = addresses[function];
        ScriptSymbol* symbol = info.FindSymbol(nullptr, opcode);
        if (symbol) symbol->Call(&target, args, false);
        if (!args.IsArgs()) abort();
    }
    return 0;
}

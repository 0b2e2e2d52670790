// Any bytes as JSON: what is read can be written in both forms, and the JSON is read as the same.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "core/ScriptVal.h"

using namespace Korvel;

namespace {

void Check(bool holds) {
    if (!holds) abort();
}

// Into blocks of just the size, so that AddressSanitizer sees what is too much.
void CheckText(const ScriptVal& value) {
    for (unsigned int options = 0; options < 16; options++) {
        int length = value.ToTextLen(0, options);
        Check(length >= 0);
        std::vector<char> text(static_cast<size_t>(length) + 1);
        Check(value.ToText(text.data(), 0, options) == text.data() + length);
        Check(strlen(text.data()) == static_cast<size_t>(length));
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string bytes(reinterpret_cast<const char*>(data), size);
    ScriptVal value("before"), again;
    if (!value.FromJSON(bytes.c_str())) {
        Check(value == "before");
        return 0;
    }
    CheckText(value);
    OxStringT<char> json, other;
    Check(value.ToJSON(json) && again.FromJSON(json) && again.ToJSON(other));
    Check(json == other);
    // JSON may lose the last bit of a number, which the text form does not show.
    Check(value.ToText(json, 0, 0) && again.ToText(other, 0, 0) && json == other);
    return 0;
}

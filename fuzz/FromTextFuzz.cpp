// Any text through the reader for foreign text; what came to an end there goes through the reader
// for our own, too. A value that comes out is written and read until it is what its text says:
// from then on it comes back as it was.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "core/ScriptText.h"
#include "core/ScriptTextInternal.h"

using namespace Korvel;

namespace {

// Texts that the own process may read and a fuzzer may not: without end, or to the system.
bool IsTame(const std::string& text) {
    for (const char* word : {"MemBlock", "dofile", "include", "print", "rep", "load"}) {
        if (text.find(word) != std::string::npos) return false;
    }
    return true;
}

// False where the text form cannot hold the value: it nests too deeply for the compiler, or has
// numbers that are none.
bool WriteAndRead(const ScriptVal& value, ScriptVal& read) {
    OxStringT<char> text;
    if (!value.ToText(text, 0, 0)) abort();
    if (text.GetLength() != value.ToTextLen(0, 0)) abort();
    char err[300] = "";
    if (read.FromText(text, GetSerializePrologue(), err, sizeof err, false, 0)) return true;
    if (strstr(err, "syntax levels") || strstr(err, "'inf'") || strstr(err, "'nan'")) return false;
    abort();
}

void CheckRoundTrip(const ScriptVal& value) {
    ScriptVal first, second;
    if (!WriteAndRead(value, first) || !WriteAndRead(first, second)) return;
    if (!(first == second)) abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string text(reinterpret_cast<const char*>(data), size);
    ScriptVal value;
    char err[64] = "";
    if (!FromForeignText(value, text.c_str(), err, sizeof err)) {
        if (!value.IsNil()) abort();
        return 0;
    }
    CheckRoundTrip(value);
    if (!IsTame(text)) return 0;
    if (value.FromText(text.c_str())) CheckRoundTrip(value);
    value.FromTextByName(text.c_str(), "a.b", err, sizeof err, false, 0);
    return 0;
}

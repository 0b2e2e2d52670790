// Whatever text comes over the network runs to an end within its limits, and a text of our own
// compiles or fails. The first byte chooses.
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "textform/Interpreter.h"

using namespace Korvel::TextForm;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0) return 0;
    std::string_view text(reinterpret_cast<const char*>(data) + 1, size - 1);
    Interpreter interpreter(Limits{100000, 4 << 20});
    State& L = interpreter.GetState();
    bool isForeign = data[0] % 2;
    Status status = L.RunProtected(
        [&] {
            OpenBase(L, BaseLevel::Foreign);
            if (isForeign) return;
            OpenCoroutine(L);
            OpenString(L);
            OpenTable(L);
            OpenMath(L);
        },
        L.m_Top, 0);
    if (status != Status::Ok) abort();
    status = L.LoadBuffer(text, "=fuzz", !isForeign);
    if (status == Status::Ok) status = L.ProtectedCall(0, 1);
    if (interpreter.GetMachine().m_Exceeded != Status::Ok && status == Status::Ok) abort();
    if (L.m_Top != L.m_Base + 1) abort();
    return 0;
}

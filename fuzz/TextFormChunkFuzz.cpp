// Precompiled chunks: the input is what stands behind the header. What the checker lets through
// runs, collects and is written again without harm.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "textform/Chunk.h"
#include "textform/Interpreter.h"

using namespace Korvel::TextForm;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string chunk(reinterpret_cast<const char*>(kChunkHeader), sizeof kChunkHeader);
    chunk.append(reinterpret_cast<const char*>(data), size);
    Interpreter interpreter(Limits{50000, 8 << 20});
    State& L = interpreter.GetState();
    OpenBase(L, BaseLevel::Foreign);
    OpenCoroutine(L);
    OpenString(L);
    if (L.LoadBuffer(chunk, "=fuzz") != Status::Ok) return 0;
    std::string again;
    auto append = [](const void* bytes, size_t count, void* state) {
        static_cast<std::string*>(state)->append(static_cast<const char*>(bytes), count);
        return 0;
    };
    Dump(AsScript(L.m_Top[-1].AsFunction())->m_Prototype, append, &again);
    if (L.LoadBuffer(again, "=again") != Status::Ok &&
        interpreter.GetMachine().m_Exceeded == Status::Ok) {
        abort();
    }
    L.Pop();
    L.PushString("argument");
    L.ProtectedCall(1, 1);
    return 0;
}

// string.format and the functions that take patterns, with any text for the directive, the pattern
// and the subject. The parts of the input are divided by line feeds.
#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "textform/Interpreter.h"
#include "textform/Opcodes.h"

using namespace Korvel::TextForm;

namespace {

void Call(State& L, const char* name, std::initializer_list<Value> args) {
    L.SetTop(0);
    L.PushField(L.m_Globals, "string");
    L.PushField(L.m_Top[-1].AsTable(), name);
    for (const Value& arg : args) L.Push(arg);
    L.ProtectedCall(static_cast<int>(args.size()), kAllResults);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size > 300) return 0;  // patterns may take time beyond all measure
    std::string_view rest(reinterpret_cast<const char*>(data), size);
    Interpreter interpreter;
    State& L = interpreter.GetState();
    OpenString(L);
    Value parts[4];
    for (Value& part : parts) {
        size_t end = std::min(rest.find('\n'), rest.size());
        part = Value::Of(L.PushString(rest.substr(0, std::min<size_t>(end, 60))));
        rest.remove_prefix(std::min(end + 1, rest.size()));
    }
    Machine::GcPause pause(interpreter.GetMachine());  // the parts stand nowhere
    Call(L, "format", {parts[0], parts[1], parts[2], Value::Number(-1e300)});
    Call(L, "format", {parts[0], Value::Number(static_cast<double>(size)), parts[3]});
    std::string_view pattern = parts[0].AsString()->GetView();
    long repeats = 0;
    for (char c : pattern) repeats += c == '*' || c == '+' || c == '-' || c == '?';
    if (repeats > 4) return 0;
    Call(L, "find", {parts[1], parts[0]});
    Call(L, "match", {parts[1], parts[0], Value::Number(-3)});
    Call(L, "gsub", {parts[1], parts[0], parts[2]});
    Call(L, "find", {parts[1], parts[0], Value::Number(1), Value::Boolean(true)});
    return 0;
}

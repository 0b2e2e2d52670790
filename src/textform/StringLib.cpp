// The string library. Searches: StringLib_Search.cpp; format: StringLib_Format.cpp.
#include <algorithm>
#include <string>

#include "textform/Chars.h"
#include "textform/Chunk.h"
#include "textform/Interpreter.h"
#include "textform/StringLibInternal.h"

namespace Korvel::TextForm {

namespace {

int StringByte(State& L) {
    String* text = L.CheckString(1);
    auto length = static_cast<int64_t>(text->m_Length);
    int64_t first = GetPosition(L.OptInteger(2, 1), text->m_Length);
    int64_t last = GetPosition(L.OptInteger(3, first), text->m_Length);
    first = std::max<int64_t>(first, 1);
    last = std::min(last, length);
    if (first > last) return 0;
    int64_t count = last - first + 1;
    if (count > State::kMaxNativeStack) L.Error("stack overflow (string slice too long)");
    L.NeedNativeStack(static_cast<int>(count), "string slice too long");
    for (int64_t i = first; i <= last; i++) {
        L.PushNumber(static_cast<unsigned char>(text->GetText()[i - 1]));
    }
    return static_cast<int>(count);
}

int StringChar(State& L) {
    int count = L.GetArgCount();
    std::string text;
    for (int i = 1; i <= count; i++) {
        int c = L.CheckInt(i);
        if (c < 0 || c > 255) L.ArgError(i, "invalid value");
        text.push_back(static_cast<char>(c));
    }
    L.PushString(text);
    return 1;
}

int AppendDump(const void* data, size_t size, void* state) {
    static_cast<std::string*>(state)->append(static_cast<const char*>(data), size);
    return 0;
}

int StringDump(State& L) {
    L.CheckType(1, Type::Function);
    L.SetTop(1);
    Closure* function = L.Arg(1).AsFunction();
    if (function->IsNative()) L.Error("unable to dump given function");
    std::string bytes;
    Dump(AsScript(function)->m_Prototype, AppendDump, &bytes);
    L.PushString(bytes);
    return 1;
}

int StringLen(State& L) {
    L.PushNumber(static_cast<double>(L.CheckString(1)->m_Length));
    return 1;
}

template <int (*kChange)(int)>
int StringChange(State& L) {
    String* text = L.CheckString(1);
    size_t length = text->m_Length;
    char* buffer = L.GetMachine().NeedScratch(length);
    const char* from = text->GetText();
    for (size_t i = 0; i < length; i++) {
        buffer[i] = static_cast<char>(kChange(static_cast<unsigned char>(from[i])));
    }
    L.PushString({buffer, length});
    return 1;
}

int StringLower(State& L) {
    return StringChange<ToLower>(L);
}

int StringUpper(State& L) {
    return StringChange<ToUpper>(L);
}

int StringRep(State& L) {
    String* text = L.CheckString(1);
    int count = L.CheckInt(2);
    size_t length = text->m_Length;
    if (count <= 0 || length == 0) {
        L.PushString("");
        return 1;
    }
    if (length > SIZE_MAX / 4 / static_cast<size_t>(count)) L.GetMachine().RaiseMemoryError();
    size_t total = length * static_cast<size_t>(count);
    char* buffer = L.GetMachine().NeedScratch(total);
    for (size_t i = 0; i < total; i += length) memcpy(buffer + i, text->GetText(), length);
    L.PushString({buffer, total});
    return 1;
}

int StringReverse(State& L) {
    String* text = L.CheckString(1);
    size_t length = text->m_Length;
    char* buffer = L.GetMachine().NeedScratch(length);
    std::reverse_copy(text->GetText(), text->GetText() + length, buffer);
    L.PushString({buffer, length});
    return 1;
}

int StringSub(State& L) {
    String* text = L.CheckString(1);
    auto length = static_cast<int64_t>(text->m_Length);
    int64_t first = GetPosition(L.CheckInteger(2), text->m_Length);
    int64_t last = GetPosition(L.OptInteger(3, -1), text->m_Length);
    first = std::max<int64_t>(first, 1);
    last = std::min(last, length);
    if (first > last) {
        L.PushString("");
    } else {
        L.PushString(text->GetView().substr(static_cast<size_t>(first) - 1,
                                            static_cast<size_t>(last - first) + 1));
    }
    return 1;
}

constexpr NativeEntry kFunctions[] = {
    {"byte", StringByte},       {"char", StringChar},     {"dump", StringDump},
    {"find", StringFind},       {"format", StringFormat}, {"gfind", StringGmatch},
    {"gmatch", StringGmatch},   {"gsub", StringGsub},     {"len", StringLen},
    {"lower", StringLower},     {"match", StringMatch},   {"rep", StringRep},
    {"reverse", StringReverse}, {"sub", StringSub},       {"upper", StringUpper},
};

}  // namespace

void OpenString(State& L) {
    Machine::GcPause pause(L.GetMachine());
    Table* library = OpenLibrary(L, "string", kFunctions);
    L.SetField(library, "gfind", *library->Get(L.GetMachine().NewString("gmatch")));
    Table* metatable = L.PushTable(0, 1);
    L.SetField(metatable, "__index", Value::Of(library));
    L.GetMachine().m_TypeMetatables[static_cast<int>(Type::String)] = metatable;
    L.Pop(2);
}

}  // namespace Korvel::TextForm

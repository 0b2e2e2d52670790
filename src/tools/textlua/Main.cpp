// Runs a program file in the interpreter of the text form. Added to its libraries: io.write and
// os.clock.
#include <cstdio>
#include <ctime>

#include "textform/Interpreter.h"

namespace {

using namespace Korvel::TextForm;

int IoWrite(State& L) {
    for (int i = 1, count = L.GetArgCount(); i <= count; i++) {
        String* text = L.CheckString(i);
        fwrite(text->GetText(), 1, text->m_Length, stdout);
    }
    return 0;
}

int OsClock(State& L) {
    L.PushNumber(static_cast<double>(clock()) / CLOCKS_PER_SEC);
    return 1;
}

constexpr NativeEntry kIo[] = {{"write", IoWrite}};
constexpr NativeEntry kOs[] = {{"clock", OsClock}};

int Run(State& L, const char* file) {
    Status status = L.RunProtected(
        [&] {
            OpenBase(L);
            OpenString(L);
            OpenTable(L);
            OpenMath(L);
            OpenLibrary(L, "io", kIo);
            OpenLibrary(L, "os", kOs);
            L.Pop(2);
            L.PushField(L.m_Globals, "dofile");
            L.PushString(file);
            L.Call(1, 0);
        },
        L.m_Top, 0);
    if (status == Status::Ok) return 0;
    const char* message = L.ToString(L.m_Top - 1) ? L.m_Top[-1].AsString()->GetText()
                                                  : "(error object is not a string)";
    fflush(stdout);
    fprintf(stderr, "textlua: %s\n", message);
    return 1;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        fprintf(stderr, "usage: textlua FILE\n");
        return 2;
    }
    Interpreter interpreter;
    return Run(interpreter.GetState(), argv[1]);
}

// The functions that compile chunks.
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "textform/BaseLibInternal.h"
#include "textform/Interpreter.h"
#include "textform/Opcodes.h"

namespace Korvel::TextForm {

namespace {

// Nil and the message, or the function.
int ReturnLoaded(State& L, Status status) {
    if (status == Status::Ok) return 1;
    if (status == Status::LimitError) L.Throw(status);
    L.PushNil();
    L.Push(L.m_Top[-2]);
    return 2;
}

int BaseLoadString(State& L) {
    String* text = L.CheckString(1);
    std::string_view name = L.OptString(2, text->GetView());
    return ReturnLoaded(L, L.LoadBuffer(text->GetView(), name.data()));
}

// Calls the function for a piece; it stays on the stack, in place 3, while it is read.
const char* ReadFromFunction(State& L, void*, size_t* size) {
    L.NeedNativeStack(2, "too many nested functions");
    L.Push(L.m_Base[0]);
    L.Call(0, 1);
    if (L.m_Top[-1].IsNil()) {
        L.Pop();
        *size = 0;
        return nullptr;
    }
    if (!L.ToString(L.m_Top - 1)) L.Error("reader function must return a string");
    L.m_Base[2] = L.m_Top[-1];
    L.Pop();
    *size = L.m_Base[2].AsString()->m_Length;
    return L.m_Base[2].AsString()->GetText();
}

int BaseLoad(State& L) {
    std::string_view name = L.OptString(2, "=(load)");
    L.CheckType(1, Type::Function);
    L.SetTop(3);
    return ReturnLoaded(L, L.Load(ReadFromFunction, nullptr, name.data()));
}

// A file in pieces. A first line that begins with '#' is left out.
class FileReader {
public:
    explicit FileReader(FILE* file) : m_File(file) {}
    FileReader(const FileReader&) = delete;
    FileReader& operator=(const FileReader&) = delete;
    ~FileReader() {
        if (m_File && m_File != stdin) fclose(m_File);
    }

    void SkipFirstComment() {
        int c = getc(m_File);
        if (c == '#') {
            while (c != EOF && c != '\n') c = getc(m_File);
            if (c == '\n') {
                m_Buffer[0] = '\n';  // so that lines keep their numbers
                m_Pending = 1;
            }
            return;
        }
        if (c != EOF) ungetc(c, m_File);
    }

    static const char* Read(State&, void* state, size_t* size) {
        auto* self = static_cast<FileReader*>(state);
        *size = self->m_Pending ? self->m_Pending
                                : fread(self->m_Buffer, 1, sizeof self->m_Buffer, self->m_File);
        self->m_Pending = 0;
        return *size ? self->m_Buffer : nullptr;
    }
    bool HasFailed() const { return ferror(m_File) != 0; }

private:
    FILE* m_File;
    size_t m_Pending = 0;
    char m_Buffer[4096];
};

// Pushes the function, or the message.
Status LoadFile(State& L, const char* name) {
    auto fail = [&](const char* what) {
        L.PushFormat("cannot %s %s: %s", what, name ? name : "stdin", strerror(errno));
        return Status::RunError;
    };
    FILE* file = name ? fopen(name, "rb") : stdin;
    if (!file) return fail("open");
    FileReader reader(file);
    reader.SkipFirstComment();
    errno = 0;
    int place = L.GetArgCount();
    if (name) {
        L.PushFormat("@%s", name);
    } else {
        L.PushString("=stdin");
    }
    Status status = L.Load(FileReader::Read, &reader, L.m_Top[-1].AsString()->GetText());
    L.m_Base[place] = L.m_Top[-1];
    L.SetTop(place + 1);
    return reader.HasFailed() ? fail("read") : status;
}

int BaseLoadFile(State& L) {
    const char* name = L.IsNoneOrNil(1) ? nullptr : L.CheckString(1)->GetText();
    return ReturnLoaded(L, LoadFile(L, name));
}

int BaseDoFile(State& L) {
    const char* name = L.IsNoneOrNil(1) ? nullptr : L.CheckString(1)->GetText();
    int before = L.GetArgCount();
    if (LoadFile(L, name) != Status::Ok) L.ThrowValue();
    L.Call(0, kAllResults);
    return L.GetArgCount() - before;
}

constexpr NativeEntry kFunctions[] = {
    {"dofile", BaseDoFile},
    {"load", BaseLoad},
    {"loadfile", BaseLoadFile},
    {"loadstring", BaseLoadString},
};

}  // namespace

void RegisterLoading(State& L) {
    Register(L, L.m_Globals, kFunctions);
}

}  // namespace Korvel::TextForm

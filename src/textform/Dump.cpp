#include "textform/Chunk.h"

namespace Korvel::TextForm {

namespace {

class Dumper {
public:
    Dumper(ChunkWriter writer, void* state) : m_Writer(writer), m_State(state) {}

    int GetResult() const { return m_Result; }

    void Write(const void* data, size_t size) {
        if (m_Result == 0 && size) m_Result = m_Writer(data, size, m_State);
    }
    template <class T>
    void Write(T value) {
        Write(&value, sizeof value);
    }
    template <class T>
    void WriteArray(const T* items, int count) {
        Write(count);
        Write(items, static_cast<size_t>(count) * sizeof(T));
    }
    // With the zero behind it; a string that is not there has size 0.
    void WriteText(const String* text) {
        Write(text ? text->m_Length + 1 : size_t{0});
        if (text) Write(text->GetText(), text->m_Length + 1);
    }
    void WriteFunction(const Prototype* p, const String* outerSource);

private:
    void WriteConstants(const Prototype* p);
    void WriteDebug(const Prototype* p);

    ChunkWriter m_Writer;
    void* m_State;
    int m_Result = 0;
};

void Dumper::WriteConstants(const Prototype* p) {
    Write(p->m_ConstantCount);
    for (int i = 0; i < p->m_ConstantCount; i++) {
        const Value& constant = p->m_Constants[i];
        Write(static_cast<uint8_t>(constant.m_Type));
        switch (constant.m_Type) {
            case Type::Boolean:
                Write(static_cast<uint8_t>(constant.m_Boolean));
                break;
            case Type::Number:
                Write(constant.m_Number);
                break;
            case Type::String:
                WriteText(constant.AsString());
                break;
            default:
                break;
        }
    }
}

void Dumper::WriteDebug(const Prototype* p) {
    WriteArray(p->m_Lines, p->m_LineCount);
    Write(p->m_LocalCount);
    for (int i = 0; i < p->m_LocalCount; i++) {
        WriteText(p->m_Locals[i].m_Name);
        Write(p->m_Locals[i].m_StartPc);
        Write(p->m_Locals[i].m_EndPc);
    }
    Write(p->m_UpValueNameCount);
    for (int i = 0; i < p->m_UpValueNameCount; i++) WriteText(p->m_UpValueNames[i]);
}

// The source is written once, with the outermost function.
void Dumper::WriteFunction(const Prototype* p, const String* outerSource) {
    WriteText(p->m_Source == outerSource ? nullptr : p->m_Source);
    Write(p->m_LineDefined);
    Write(p->m_LastLineDefined);
    Write(p->m_UpValueCount);
    Write(p->m_ParameterCount);
    Write(p->m_VarargFlags);
    Write(p->m_MaxStackSize);
    WriteArray(p->m_Code, p->m_CodeCount);
    WriteConstants(p);
    Write(p->m_PrototypeCount);
    for (int i = 0; i < p->m_PrototypeCount; i++) WriteFunction(p->m_Prototypes[i], p->m_Source);
    WriteDebug(p);
}

}  // namespace

int Dump(const Prototype* prototype, ChunkWriter writer, void* writerState) {
    Dumper dumper(writer, writerState);
    dumper.Write(kChunkHeader, sizeof kChunkHeader);
    dumper.WriteFunction(prototype, nullptr);
    return dumper.GetResult();
}

}  // namespace Korvel::TextForm

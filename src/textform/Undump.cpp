#include <algorithm>
#include <iterator>

#include "textform/Chunk.h"
#include "textform/Lexer.h"

namespace Korvel::TextForm {

namespace {

class Undumper {
public:
    Undumper(State& L, Source& source, const char* name)
        : m_State(L), m_Machine(L.GetMachine()), m_Source(source), m_Name(name) {}

    void ReadHeader();
    Prototype* ReadFunction(String* outerSource);

private:
    static constexpr int kMaxDepth = State::kMaxNativeCalls;
    static constexpr int kFirstItems = 1024;

    [[noreturn]] void Fail(const char* why);
    void Read(void* data, size_t size);
    template <class T>
    T Read() {
        T value;
        Read(&value, sizeof value);
        return value;
    }
    int ReadCount() {
        int count = Read<int>();
        if (count < 0) Fail("bad integer");
        return count;
    }
    String* ReadString();
    // Reads `count` items one by one into an array that grows with what was read, so that a count
    // alone takes no memory.
    template <class T, class ReadItem>
    void ReadArray(T*& array, int& size, ReadItem readItem) {
        int count = ReadCount();
        for (int i = 0; i < count; i++) {
            if (i == size) {
                int wanted = std::min(count, std::max(kFirstItems, size * 2));
                array = m_Machine.ResizeArray(array, size, wanted);
                std::fill_n(array + size, wanted - size, T());
                size = wanted;
            }
            array[i] = readItem();
        }
    }
    Value ReadConstant();

    State& m_State;
    Machine& m_Machine;
    Source& m_Source;
    const char* m_Name;
    int m_Depth = 0;
};

void Undumper::Fail(const char* why) {
    m_State.PushFormat("%s: %s in precompiled chunk", m_Name, why);
    m_State.Throw(Status::SyntaxError);
}

void Undumper::Read(void* data, size_t size) {
    auto* out = static_cast<char*>(data);
    while (size > 0) {
        auto rest = static_cast<size_t>(m_Source.GetEnd() - m_Source.GetPlace());
        if (rest == 0) {
            int c = m_Source.Get();
            if (c == Source::kEnd) Fail("unexpected end");
            *out++ = static_cast<char>(c);
            size--;
            continue;
        }
        size_t part = std::min(rest, size);
        memcpy(out, m_Source.GetPlace(), part);
        m_Source.Advance(m_Source.GetPlace() + part);
        out += part;
        size -= part;
    }
}

void Undumper::ReadHeader() {
    unsigned char header[sizeof kChunkHeader];
    Read(header, sizeof header);
    if (memcmp(header, kChunkHeader, sizeof header) != 0) Fail("bad header");
}

String* Undumper::ReadString() {
    auto size = Read<size_t>();
    if (size == 0) return nullptr;
    std::string text;
    constexpr size_t kPart = 65536;
    for (size_t done = 0; done < size;) {
        size_t part = std::min(kPart, size - done);
        text.resize(done + part);
        Read(text.data() + done, part);
        done += part;
    }
    return m_Machine.NewString(text.data(), size - 1);
}

Value Undumper::ReadConstant() {
    switch (static_cast<Type>(Read<uint8_t>())) {
        case Type::Nil:
            return Value::Nil();
        case Type::Boolean:
            return Value::Boolean(Read<uint8_t>() != 0);
        case Type::Number:
            return Value::Number(Read<double>());
        case Type::String: {
            String* text = ReadString();
            return Value::Of(text ? text : m_Machine.NewString(""));
        }
        default:
            Fail("bad constant");
    }
}

Prototype* Undumper::ReadFunction(String* outerSource) {
    if (++m_Depth + m_State.m_NativeCalls > kMaxDepth) Fail("code too deep");
    Prototype* p = NewPrototype(m_Machine);
    String* source = ReadString();
    p->m_Source = source ? source : outerSource;
    p->m_LineDefined = ReadCount();
    p->m_LastLineDefined = ReadCount();
    p->m_UpValueCount = Read<uint8_t>();
    p->m_ParameterCount = Read<uint8_t>();
    p->m_VarargFlags = Read<uint8_t>();
    p->m_MaxStackSize = Read<uint8_t>();
    auto readName = [&] {
        String* name = ReadString();
        return name ? name : m_Machine.NewString("?");
    };
    ReadArray(p->m_Code, p->m_CodeCount, [&] { return Read<Instruction>(); });
    ReadArray(p->m_Constants, p->m_ConstantCount, [&] { return ReadConstant(); });
    ReadArray(p->m_Prototypes, p->m_PrototypeCount, [&] { return ReadFunction(p->m_Source); });
    ReadArray(p->m_Lines, p->m_LineCount, [&] { return Read<int>(); });
    ReadArray(p->m_Locals, p->m_LocalCount, [&] {
        LocalVariable local;
        local.m_Name = readName();
        local.m_StartPc = Read<int>();
        local.m_EndPc = Read<int>();
        return local;
    });
    ReadArray(p->m_UpValueNames, p->m_UpValueNameCount, readName);
    if (!CheckCode(p)) Fail("bad code");
    m_Depth--;
    return p;
}

}  // namespace

Prototype* Undump(State& L, Source& source, const char* chunkName) {
    const char* name = chunkName;
    if (*name == '@' || *name == '=') {
        name++;
    } else if (*name == kBinaryMark) {
        name = "binary string";
    }
    Undumper undumper(L, source, name);
    undumper.ReadHeader();
    return undumper.ReadFunction(L.GetMachine().NewString("=?"));
}

}  // namespace Korvel::TextForm

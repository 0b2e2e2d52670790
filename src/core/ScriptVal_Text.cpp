// The text form, as it is written. One walk over the value serves for measuring and for writing, so
// the two cannot differ.
#include <array>
#include <charconv>
#include <climits>
#include <clocale>
#include <cstdio>
#include <memory>
#include <string_view>

#include "Platform/FilesInternal.h"
#include "Platform/NoKillInternal.h"
#include "core/NumbersInternal.h"
#include "core/ScriptTextInternal.h"
#include "core/ScriptValInternal.h"
#include "core/SpinLock.h"

namespace Korvel {
namespace {

constinit SpinLock s_LocaleLock;
constinit std::atomic<const char*> s_NameOfC{nullptr};  // the C library's own text

// The name of a locale may be released as soon as another one is set, so it is only looked into
// under the lock. That of "C" always lies at the same place.
void EnsureCLocale() {
    if (setlocale(LC_ALL, nullptr) == s_NameOfC.load(std::memory_order_relaxed)) return;
    Platform::NoKill noKill;
    AutoSpinLock lock(s_LocaleLock);
    const char* name = setlocale(LC_ALL, nullptr);
    if (!name || strcmp(name, "C") != 0) name = setlocale(LC_ALL, "C");
    s_NameOfC.store(name, std::memory_order_relaxed);
}

constexpr bool IsDigit(char c) {
    return c >= '0' && c <= '9';
}

// Letters and digits of ASCII, and "_".
constexpr auto kNameBytes = [] {
    std::array<bool, 256> table{};
    for (int c = '0'; c <= '9'; c++) table[static_cast<size_t>(c)] = true;
    for (int c = 'A'; c <= 'Z'; c++) table[static_cast<size_t>(c)] = true;
    for (int c = 'a'; c <= 'z'; c++) table[static_cast<size_t>(c)] = true;
    table['_'] = true;
    return table;
}();

bool IsKeyword(std::string_view s) {
    switch (s.size()) {
        case 2:
            return s == "do" || s == "if" || s == "in" || s == "or";
        case 3:
            return s == "and" || s == "end" || s == "for" || s == "nil" || s == "not";
        case 4:
            return s == "else" || s == "then" || s == "true";
        case 5:
            return s == "break" || s == "false" || s == "local" || s == "until" || s == "while";
        case 6:
            return s == "elseif" || s == "repeat" || s == "return";
        case 8:
            return s == "function";
        default:
            return false;
    }
}

// It may stand bare, as a key or as part of a constructor.
bool IsName(std::string_view text) {
    if (text.empty() || IsDigit(text[0])) return false;
    for (char c : text) {
        if (!kNameBytes[static_cast<unsigned char>(c)]) return false;
    }
    return !IsKeyword(text);
}

// It makes the reader give a table this name, and nothing else.
bool IsConstructor(std::string_view text) {
    return IsIdentifierPath(text) && NamesConstructor(text);
}

constexpr uint64_t Repeat(char c) {
    return static_cast<unsigned char>(c) * 0x0101010101010101u;
}

// Eight bytes at a time. The subtraction borrows into a byte only above one that is found.
bool HasEscapes(const char* bytes, uint64_t quotes) {
    uint64_t word;
    memcpy(&word, bytes, sizeof word);
    auto find = [word](uint64_t wanted) {
        uint64_t rest = word ^ wanted;
        return (rest - Repeat(1)) & ~rest;
    };
    uint64_t found = find(Repeat('\\')) | find(quotes) | find(Repeat('\n')) | find(Repeat('\r'));
    return (found & Repeat('\x80')) != 0;
}

// How many bytes at the head of a text go out as they are.
size_t CountPlain(std::string_view text, char quote) {
    constexpr size_t kStep = sizeof(uint64_t);
    const char* bytes = text.data();
    size_t size = text.size();
    size_t i = 0;
    if (size >= kStep) {
        uint64_t quotes = Repeat(quote);
        while (i + kStep <= size && !HasEscapes(bytes + i, quotes)) i += kStep;
        if (i + kStep > size && !HasEscapes(bytes + size - kStep, quotes)) return size;
    }
    for (; i < size; i++) {
        char c = bytes[i];
        if (c == '\\' || c == quote || c == '\n' || c == '\r') break;
    }
    return i;
}

// Where the text goes: only its length is counted, or it is written.

class Counter {
public:
    void Put(char) { m_Length++; }
    void Put(std::string_view text) { m_Length += text.size(); }
    void Fill(char, int64_t count) { m_Length += static_cast<uint64_t>(count); }

    uint64_t m_Length = 0;
};

class Buffer {
public:
    explicit Buffer(char* at) : m_At(at) {}

    void Put(char c) { *m_At++ = c; }
    void Put(std::string_view text) {
        memcpy(m_At, text.data(), text.size());
        m_At += text.size();
    }
    void Fill(char c, int64_t count) {
        memset(m_At, c, static_cast<size_t>(count));
        m_At += count;
    }

    char* m_At;
};

template <class Sink>
class TextWriter {
public:
    template <class... Args>
    explicit TextWriter(unsigned int options, Args... args)
        : m_Sink(args...),
          m_Options(options),
          m_Quote((options & TXT_SingleQuotes) != 0 ? '\'' : '"') {}

    // False when tables nest too deeply.
    [[nodiscard]] bool Write(const ScriptVal& value, int64_t indent, int depth);

    Sink m_Sink;

private:
    struct ListState {
        int64_t m_Tabs;  // in front of an entry
        bool m_IsCompact;
        bool m_IsExplicit;
        uint32_t m_Count = 0;  // entries written
        float m_Position = 1;  // the next one that needs no key

        // Compact tables begin a new line after so many entries.
        bool IsLineFull() const { return m_Count % 256 == 0 && m_Count != 0; }
    };

    bool WriteList(const ScriptVal& list, int64_t indent, int depth);
    std::string_view WriteHead(const ScriptVal& list, bool isOrdered, ListState& state);
    void BeginEntry(const ListState& state);
    void EndEntry(ListState& state, bool hasNext, bool isTable);
    void WriteKey(const ScriptVal& key, ListState& state);
    void WriteText(std::string_view text);
    void WriteNumber(const ScriptVal& number);
    void WriteBlock(const MemBlock& block, int64_t indent);
    void WriteReference(std::string_view tag, uint64_t address);

    void PutTabs(int64_t count) {
        if (count > 0) m_Sink.Fill('\t', count);
    }
    bool Has(TextOptions option) const { return (m_Options & option) != 0; }

    const unsigned int m_Options;
    const char m_Quote;
};

template <class Sink>
bool TextWriter<Sink>::Write(const ScriptVal& value, int64_t indent, int depth) {
    switch (value.Type()) {
        case SV_Nil:
        case SV_Code:
            m_Sink.Put("nil");
            break;
        case SV_Number:
            WriteNumber(value);
            break;
        case SV_String:
            WriteText(value.ToString());
            break;
        case SV_Boolean:
            m_Sink.Put(value.ToBoolean() ? "true" : "false");
            break;
        case SV_Table:
        case SV_Args:
            return WriteList(value, indent, depth);
        case SV_Function:
            WriteReference("func", value.ToFunction());
            break;
        case SV_RemoteObject:
            WriteReference("robj", reinterpret_cast<uint64_t>(value.ToRemoteObject()));
            break;
        case SV_MemBlock:
            WriteBlock(value.ToMemBlock(), indent);
            break;
        case SV_Pointer:
            WriteReference("ptr", value.m_Value.m_Pointer);
            break;
        default:
            WriteReference("lobj", reinterpret_cast<uint64_t>(value.ToLocalObject()));
            break;
    }
    return true;
}

template <class Sink>
bool TextWriter<Sink>::WriteList(const ScriptVal& list, int64_t indent, int depth) {
    if (depth >= kMaxNesting) return false;
    // The other flags tell something else on args lists.
    uint32_t flags = list.m_Flags & (list.IsTable() ? ~0u : SVF_Compact);
    ListState state{.m_Tabs = indent < 0 ? 0 : indent + 1,
                    .m_IsCompact = Has(TXT_Compact) || (flags & SVF_Compact) != 0,
                    .m_IsExplicit = (flags & SVF_ExplicitKeys) != 0};
    std::string_view tail = "";
    if (!Has(TXT_Flat)) {
        tail = WriteHead(list, (flags & SVF_Ordered) != 0, state);
    } else if (indent >= 0) {
        m_Sink.Put('\n');
    }
    for (TableEntry* entry = Chain::Head(list); entry; entry = entry->m_Next) {
        const ScriptVal& value = entry->m_Value;
        if (entry->m_Key.IsNil() || value.IsNil()) continue;
        BeginEntry(state);
        WriteKey(entry->m_Key, state);
        if (!Write(value, indent + 1, depth + 1)) return false;
        EndEntry(state, entry->m_Next != nullptr, value.IsTable());
    }
    if (!tail.empty() && !state.m_IsCompact) PutTabs(indent);
    m_Sink.Put(tail);
    return true;
}

// What stands in front of the entries. Returns what stands behind them.
template <class Sink>
std::string_view TextWriter<Sink>::WriteHead(const ScriptVal& list, bool isOrdered,
                                             ListState& state) {
    const char* constructor = list.GetConstructor();
    bool isBare = constructor && IsConstructor(constructor);
    if (isOrdered) m_Sink.Put(isBare ? "ordered() (" : "ordered() ");
    if (isBare) {
        m_Sink.Put(constructor);
        m_Sink.Put(' ');
    }
    m_Sink.Put(state.m_IsCompact ? "{ " : "{\n");
    if (constructor && !isBare) {
        BeginEntry(state);
        m_Sink.Put("__ctor = ");
        WriteText(constructor);
        EndEntry(state, Chain::Head(list) != nullptr, false);
    }
    return isOrdered && isBare ? "})" : "}";
}

template <class Sink>
void TextWriter<Sink>::BeginEntry(const ListState& state) {
    if (!state.m_IsCompact || state.IsLineFull()) PutTabs(state.m_Tabs);
}

template <class Sink>
void TextWriter<Sink>::EndEntry(ListState& state, bool hasNext, bool isTable) {
    state.m_Count++;
    if (Has(TXT_Flat)) {
        if (isTable) return;
    } else if (hasNext) {
        m_Sink.Put(',');
    }
    m_Sink.Put(state.m_IsCompact && !state.IsLineFull() ? ' ' : '\n');
}

template <class Sink>
void TextWriter<Sink>::WriteKey(const ScriptVal& key, ListState& state) {
    if (key.IsString()) {
        std::string_view text(key.ToString());
        if (IsName(text)) {
            m_Sink.Put(text);
            m_Sink.Put(" = ");
        } else {
            m_Sink.Put('[');
            WriteText(text);
            m_Sink.Put("] = ");
        }
    } else if (key.IsNumber()) {
        if (!state.m_IsExplicit && key.m_Value.m_Number == state.m_Position) {
            state.m_Position++;
            return;
        }
        m_Sink.Put('[');
        WriteNumber(key);
        m_Sink.Put("] = ");
    }
}

template <class Sink>
void TextWriter<Sink>::WriteText(std::string_view text) {
    m_Sink.Put(m_Quote);
    for (;;) {
        size_t plain = CountPlain(text, m_Quote);
        m_Sink.Put(text.substr(0, plain));
        if (plain == text.size()) break;
        char c = text[plain];
        m_Sink.Put('\\');
        m_Sink.Put(c == '\n' ? 'n' : c == '\r' ? 'r' : c);
        text.remove_prefix(plain + 1);
    }
    m_Sink.Put(m_Quote);
}

template <class Sink>
void TextWriter<Sink>::WriteNumber(const ScriptVal& number) {
    char text[kNumberTextSize];
    double value = number.m_Value.m_Number;
    char* end;
    if (number.m_Flags & SVF_Integer) {
        end = std::to_chars(text, text + sizeof text, ToInt64(value)).ptr;
    } else {
        end = number.m_Flags & SVF_Narrow ? WriteFloat(text, value) : WriteDouble(text, value);
    }
    m_Sink.Put(std::string_view(text, static_cast<size_t>(end - text)));
}

template <class Sink>
void TextWriter<Sink>::WriteBlock(const MemBlock& block, int64_t indent) {
    static constexpr char kDigits[] = "0123456789ABCDEF";
    auto breakLine = [&] {
        m_Sink.Put('\n');
        if (indent >= 0) m_Sink.Fill('\t', indent + 1);
    };
    m_Sink.Put("HexData [[");
    if (block.m_Size > 16) {
        breakLine();
    } else {
        m_Sink.Put(' ');
    }
    auto* bytes = static_cast<const unsigned char*>(block.m_Ptr);
    for (uint32_t i = 0; i < block.m_Size; i++) {
        m_Sink.Put(kDigits[bytes[i] >> 4]);
        m_Sink.Put(kDigits[bytes[i] & 15]);
        if (i % 16 == 15) {
            breakLine();
        } else {
            m_Sink.Put(' ');
        }
    }
    m_Sink.Put("]]");
}

template <class Sink>
void TextWriter<Sink>::WriteReference(std::string_view tag, uint64_t address) {
    if (!Has(TXT_References)) {
        m_Sink.Put("nil");
        return;
    }
    char digits[17];
    snprintf(digits, sizeof digits, "%016llx", static_cast<unsigned long long>(address));
    m_Sink.Put(tag);
    m_Sink.Put('<');
    m_Sink.Put(digits);
    m_Sink.Put('>');
}

}  // namespace

bool IsIdentifierPath(std::string_view path) {
    for (;;) {
        size_t point = path.find('.');
        if (!IsName(path.substr(0, point))) return false;
        if (point == path.npos) return true;
        path.remove_prefix(point + 1);
    }
}

int ScriptVal::ToTextLen(int indent, unsigned int options) const {
    if (indent < 1) EnsureCLocale();
    TextWriter<Counter> writer(options);
    if (!writer.Write(*this, indent, 0) || writer.m_Sink.m_Length > INT_MAX) return -1;
    return static_cast<int>(writer.m_Sink.m_Length);
}

char* ScriptVal::ToText(char* buffer, int indent, unsigned int options) const {
    if (indent < 1) EnsureCLocale();
    TextWriter<Buffer> writer(options, buffer);
    if (!writer.Write(*this, indent, 0)) return nullptr;
    writer.m_Sink.Put('\0');
    return writer.m_Sink.m_At - 1;
}

bool ScriptVal::ToText(OxStringT<char>& out, int indent, unsigned int options) const {
    int length = ToTextLen(indent, options);
    if (length <= 0) {
        out.Empty();
        return length == 0;
    }
    auto size = static_cast<unsigned long>(length);
    char* text = size > kMaxStringLength ? nullptr : out.ObtainRaw(size);
    if (!text) return false;
    ToText(text, indent, options);
    out.ReleaseRaw(size);
    return true;
}

bool ScriptVal::Save(const char* file, unsigned int options) const {
    int length = ToTextLen(0, options);
    if (length < 0) return false;
    auto size = static_cast<unsigned long>(length);
    PoolBlock<char> buffer(static_cast<char*>(g_ReusePoolMgr.Alloc(size + 1)));
    if (!buffer) return false;
    ToText(buffer.get(), 0, options);
    Platform::File stream(Platform::fopen(file, "wc"));
    if (!stream) return false;
    bool isWritten = fwrite(buffer.get(), size, 1, stream.get()) == 1 && fflush(stream.get()) == 0;
    // Only the end of the stream tells whether its last bytes found room.
    return fclose(stream.release()) == 0 && isWritten;
}

}  // namespace Korvel

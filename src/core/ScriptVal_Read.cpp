// Reading of the text form: the text is a program, which a short-lived interpreter runs, and what
// it returns becomes the value.
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <iterator>
#include <memory>
#include <string>

#include "Platform/FilesInternal.h"
#include "core/ScriptText.h"
#include "core/ScriptTextInternal.h"
#include "core/ScriptValInternal.h"
#include "textform/Interpreter.h"
#include "textform/Numbers.h"
#include "textform/Opcodes.h"

namespace Korvel {

using TextForm::Interpreter;
using TextForm::State;
using TextForm::Status;
using TextForm::Value;

namespace {

constexpr TextForm::Limits kForeignLimits{100000, 4 << 20};

// What all readers know. The functions of languages mark a string by what is written in it.
constexpr char kCommonSetup[] = R"lua(
local sethashstate = sethashstate
local function same(value) return value end
_OpenCL, _GLSL, _CUDA, _Cg, _Markdown, _Lua, _Python = same, same, same, same, same, same, same
function tr(...) return { __ctor = "__tr", ... } end
function ordered() sethashstate(0) return same end
)lua";
constexpr char kExpressionSetup[] = R"lua(UTF8_ELLIPSIS = "\xE2\x80\xA6")lua";
constexpr char kByNameSetup[] = "include = dofile";

// Prologues stand on one line, so that messages count the lines of the text. Both make unknown
// names into records, of which calls make constructors. `keep` gives back the order that has been
// asked for when a table of their own took it.
#define KORVEL_PROLOGUE_BEGIN                                  \
    "local _ = { _parent = getfenv(1) } do "                   \
    "local setmetatable, rawget, type, getflags, order = "     \
    "setmetatable, rawget, type, gettableflags, sethashstate " \
    "local function keep(t) if getflags(t) % 2 == 0 then order(0) end return t end "

constexpr char kSerializePrologue[] = KORVEL_PROLOGUE_BEGIN
    "local record = {} "
    "function record.__call(self, arg) "
    "local args = rawget(self, 'Args') "
    "if type(arg) == 'table' then "
    "arg.__ctor = rawget(self, 'Name') if args then arg.__args = args end return arg end "
    "if not args then args = keep({}) self.Args = args end "
    "args[#args + 1] = arg return self end "
    "function record.__index(self, name) "
    "self.Name = rawget(self, 'Name') .. '.' .. name return self end "
    "setmetatable(_, { __index = function(env, name) local ret = env._parent[name] "
    "if not ret then ret = setmetatable(keep({ Name = name }), record) end return ret end }) "
    "end setfenv(1, _) return ";

constexpr char kByNamePrologue[] = KORVEL_PROLOGUE_BEGIN
    "local record = {} "
    "function record.__call(t, a) a.__ctor = rawget(t, 'name') return a end "
    "function record.__index(t, i) t.name = rawget(t, 'name') .. '.' .. i return t end "
    "setmetatable(_, { __index = function(x, n) local ret = x._parent[n] "
    "if not ret then ret = setmetatable(keep({ name = n }), record) end return ret end }) "
    "end setfenv(1, _); ";
#undef KORVEL_PROLOGUE_BEGIN

// In the order of their bytes: the globals of all readers, and what a prologue adds.
constexpr std::string_view kReaderNames[] = {
    "HexData",
    "MemBlock",
    "UTF8_ELLIPSIS",
    "_",
    "_CUDA",
    "_Cg",
    "_G",
    "_GLSL",
    "_Lua",
    "_Markdown",
    "_OpenCL",
    "_Python",
    "_VERSION",
    "_parent",
    "assert",
    "collectgarbage",
    "coroutine",
    "dofile",
    "error",
    "gcinfo",
    "getfenv",
    "getmetatable",
    "gettableflags",
    "include",
    "ipairs",
    "load",
    "loadfile",
    "loadstring",
    "math",
    "newproxy",
    "next",
    "ordered",
    "pairs",
    "pcall",
    "print",
    "rawequal",
    "rawget",
    "rawset",
    "select",
    "setfenv",
    "sethashstate",
    "setmetatable",
    "settableflags",
    "string",
    "table",
    "tonumber",
    "tostring",
    "tr",
    "type",
    "unpack",
    "xpcall",
};
static_assert(std::ranges::is_sorted(kReaderNames));

// The pieces of a chunk, in turn.
struct Source {
    std::string_view m_Pieces[3];
    size_t m_Next = 0;
};

const char* getSV(State&, void* state, size_t* size) {
    auto& source = *static_cast<Source*>(state);
    while (source.m_Next < std::size(source.m_Pieces)) {
        std::string_view piece = source.m_Pieces[source.m_Next++];
        if (piece.empty()) continue;  // it would end the chunk
        *size = piece.size();
        return piece.data();
    }
    *size = 0;
    return nullptr;
}

// A text of the caller's, or one that was handed over and is freed as soon as it has been parsed.
class InputText {
public:
    InputText(const char* text, bool isOurs) : m_Text(text), m_IsOurs(isOurs) {}
    InputText(const InputText&) = delete;
    InputText& operator=(const InputText&) = delete;
    ~InputText() { Release(); }

    std::string_view Get() const { return m_Text ? TextCell::Text(m_Text) : ""; }
    void Release() {
        if (std::exchange(m_IsOurs, false)) free(const_cast<char*>(m_Text));
    }

private:
    const char* m_Text;
    bool m_IsOurs;
};

// The caller's buffer for the message, which holds the name of the chunk before.
class Message {
public:
    Message(char* buffer, int size) : m_Buffer(size > 0 ? buffer : nullptr), m_Room(size - 1) {
        if (m_Buffer) m_Buffer[m_Room] = '\0';
    }

    const char* GetChunkName() const { return m_Buffer && *m_Buffer ? m_Buffer : "FromText"; }

    void Set(const char* text) {
        if (!m_Buffer) return;
        size_t length = strnlen(text, static_cast<size_t>(m_Room));
        memcpy(m_Buffer, text, length);
        m_Buffer[length] = '\0';
    }
    // Text of a string or number, else nothing.
    void Set(const Value& value) {
        char number[TextForm::kNumberSize];
        if (value.IsString()) return Set(value.AsString()->GetText());
        if (!value.IsNumber()) return Set("");
        TextForm::WriteNumber(number, value.m_Number);
        Set(number);
    }

private:
    char* m_Buffer;
    int m_Room;  // without the NUL, which stands
};

// Loads and runs a setup script, which is its own name, and raises its error.
void _old_my_dostringb(State& L, const char* script) {
    if (L.LoadBuffer(script, script) != Status::Ok) L.ThrowValue();
    L.Call(0, TextForm::kAllResults);
}

using Setup = void (*)(State& L);

void SetUpExpression(State& L) {
    OpenBase(L);
    OpenTable(L);
    OpenString(L);
    OpenMath(L);
    register_memblock(L);
    _old_my_dostringb(L, kCommonSetup);
    _old_my_dostringb(L, kExpressionSetup);
}

void SetUpByName(State& L) {
    OpenBase(L);
    register_memblock(L);
    _old_my_dostringb(L, kCommonSetup);
    _old_my_dostringb(L, kByNameSetup);
}

void SetUpForeign(State& L) {
    OpenBase(L, TextForm::BaseLevel::Foreign);
    register_memblock(L);
    _old_my_dostringb(L, kCommonSetup);
    _old_my_dostringb(L, kExpressionSetup);
}

bool ReadIn(Interpreter& interpreter, Setup setUp, Source source, ScriptVal& out, InputText& text,
            Message& message) {
    State& L = interpreter.GetState();
    bool isLimited = interpreter.GetMachine().m_IsLimited;
    bool isRead = false;
    Status status = L.RunProtected([&] { setUp(L); }, L.m_Top, 0);
    if (status == Status::Ok) {
        L.SetTop(0);
        status = L.Load(getSV, &source, message.GetChunkName(), !isLimited);
    }
    if (status == Status::Ok) {
        text.Release();
        status = L.ProtectedCall(0, 1);
    }
    if (status == Status::Ok) {
        auto convert = [&] {
            interpreter.GetMachine().CollectAll(L);
            isRead = _old_FromLua(L, -1, out, false);
        };
        status = L.RunProtected(convert, L.m_Top, 0);
    }
    if (status != Status::Ok) out = SV_Nil;
    message.Set(L.m_Top[-1]);
    if (status == Status::Ok && !isRead) message.Set("not enough memory");
    return isRead;
}

// `make` makes the interpreter and reads in it. Nothing that goes wrong gets out of here.
template <class Make>
bool Guarded(ScriptVal& out, Message& message, Make make) {
    try {
        return make();
    } catch (const std::exception&) {
    } catch (const TextForm::Raised&) {
    }
    out = SV_Nil;
    message.Set("not enough memory");
    return false;
}

// The text of a file; null when it cannot be read.
PoolBlock<char> ReadFile(FILE* file) {
    int64_t size = Platform::SizeOf(file);
    if (size < 0 || size == INT64_MAX) return {};
    rewind(file);
    PoolBlock<char> text(
        static_cast<char*>(g_ReusePoolMgr.Alloc(static_cast<unsigned long>(size) + 1)));
    if (!text) return {};
    size_t length = fread(text.get(), 1, static_cast<size_t>(size), file);
    text.get()[length] = '\0';
    return ferror(file) ? PoolBlock<char>() : std::move(text);
}

}  // namespace

bool NamesConstructor(std::string_view path) {
    size_t point = path.find('.');
    if (std::ranges::binary_search(kReaderNames, path.substr(0, point))) return false;
    while (point != path.npos) {
        path.remove_prefix(point + 1);
        point = path.find('.');
        std::string_view field = path.substr(0, point);
        if (field == "Name" || field == "name") return false;  // a record answers with its own
    }
    return true;
}

const char* GetSerializePrologue(TagList*) {
    return kSerializePrologue;
}

bool _ScriptVal_FromText(ScriptVal& out, const char* text, const char* prefix, char* err,
                         int errlen, bool freeText, unsigned int) {
    InputText input(text, freeText);
    Message message(err, errlen);
    return Guarded(out, message, [&] {
        Interpreter interpreter;
        Source source{{prefix ? TextCell::Text(prefix) : "return ", input.Get(), ""}};
        return ReadIn(interpreter, SetUpExpression, source, out, input, message);
    });
}

bool _ScriptVal_FromTextByName(ScriptVal& out, const char* text, const char* name, char* err,
                               int errlen, bool freeText, unsigned int) {
    InputText input(text, freeText);
    Message message(err, errlen);
    std::string_view path = name ? TextCell::Text(name) : "";
    if (!IsIdentifierPath(path)) {
        out = SV_Nil;
        message.Set("The name is no identifier.");
        return false;
    }
    return Guarded(out, message, [&] {
        Interpreter interpreter;
        std::string suffix = "\nreturn ";  // behind a text that ends in a comment, too
        suffix.append(path);
        Source source{{kByNamePrologue, input.Get(), suffix}};
        return ReadIn(interpreter, SetUpByName, source, out, input, message);
    });
}

bool FromForeignText(ScriptVal& out, const char* text, char* err, int errlen) {
    InputText input(text, false);
    Message message(err, errlen);
    return Guarded(out, message, [&] {
        Interpreter interpreter(kForeignLimits);
        Source source{{kSerializePrologue, input.Get(), ""}};
        return ReadIn(interpreter, SetUpForeign, source, out, input, message);
    });
}

bool ScriptVal::FromText(const char* text) {
    return FromText(text, GetSerializePrologue(), nullptr, 0, false, 0);
}

bool ScriptVal::FromText(const char* text, const char* prefix, char* err, int errlen, bool freeText,
                         unsigned int options) {
    return _ScriptVal_FromText(*this, text, prefix, err, errlen, freeText, options);
}

bool ScriptVal::FromTextByName(const char* text, const char* name, char* err, int errlen,
                               bool freeText, unsigned int options) {
    return _ScriptVal_FromTextByName(*this, text, name, err, errlen, freeText, options);
}

bool ScriptVal::Load(const char* file, char* err, int errlen, unsigned int) {
    Platform::File stream(Platform::fopen(file, "rb"));
    if (!stream) return false;
    PoolBlock<char> text = ReadFile(stream.get());
    stream.reset();
    if (!text) return false;
    return _ScriptVal_FromText(*this, text.get(), GetSerializePrologue(), err, errlen, false, 0);
}

}  // namespace Korvel

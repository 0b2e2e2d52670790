#include "textform/Lexer.h"

#include <climits>

#include "textform/Chars.h"
#include "textform/Numbers.h"

namespace Korvel::TextForm {

namespace {

constexpr const char* kTokenNames[] = {
    "and",      "break", "do",   "else",     "elseif", "end",      "false", "for",
    "function", "if",    "in",   "local",    "nil",    "not",      "or",    "repeat",
    "return",   "then",  "true", "until",    "while",  "..",       "...",   "==",
    ">=",       "<=",    "~=",   "<number>", "<name>", "<string>", "<eof>",
};
constexpr int kReservedCount = TokenWhile - TokenAnd + 1;

int GetHexDigit(int c) {
    return c <= '9' ? c - '0' : (c | 0x20) - 'a' + 10;
}

}  // namespace

void InitReservedWords(Machine& machine) {
    for (int i = 0; i < kReservedCount; i++) {
        String* word = machine.NewString(kTokenNames[i]);
        word->m_Marks |= Machine::kFixed;
        word->m_Extra = static_cast<uint8_t>(i + 1);
    }
}

int Source::Refill() {
    size_t size = 0;
    const char* piece = m_Reader(m_State, m_ReaderState, &size);
    if (!piece || size == 0) return kEnd;
    m_Place = piece + 1;
    m_End = piece + size;
    return static_cast<unsigned char>(*piece);
}

Lexer::Lexer(State& L, Source& source, String* chunkName)
    : m_State(L), m_Source(source), m_ChunkName(chunkName) {
    m_Text.reserve(64);
    m_Ahead.m_Kind = TokenEnd_;
    Step();
}

String* Lexer::Intern(std::string_view text) {
    return m_State.GetMachine().NewString(text);
}

const char* Lexer::PushTokenName(int token) {
    if (token >= TokenAnd) return kTokenNames[token - TokenAnd];
    if (IsControl(token)) return m_State.PushFormat("char(%d)", token);
    return m_State.PushFormat("%c", token);
}

void Lexer::FailNear(const char* message, int token) {
    State& L = m_State;
    char place[kSyntaxChunkIdSize];
    GetChunkId(place, sizeof place, m_ChunkName->GetText());
    const char* text = L.PushFormat("%s:%d: %s", place, m_Line, message);
    if (token) {
        bool hasText = token == TokenName || token == TokenString || token == TokenNumber;
        const char* name = hasText ? m_Text.c_str() : PushTokenName(token);
        L.PushFormat("%s near '%s'", text, name);
    }
    L.Throw(Status::SyntaxError);
}

void Lexer::Fail(const char* message) {
    FailNear(message, m_Token.m_Kind);
}

void Lexer::Next() {
    m_LastLine = m_Line;
    if (m_Ahead.m_Kind != TokenEnd_) {
        m_Token = m_Ahead;
        m_Ahead.m_Kind = TokenEnd_;
        return;
    }
    m_Token.m_Kind = Read(m_Token);
}

int Lexer::LookAhead() {
    m_Ahead.m_Kind = Read(m_Ahead);
    return m_Ahead.m_Kind;
}

// A line may end in either character or in both.
void Lexer::SkipLineEnd() {
    int first = m_Char;
    Step();
    if (IsLineEnd() && m_Char != first) Step();
    if (++m_Line >= INT_MAX - 2) FailNear("chunk has too many lines", 0);
}

bool Lexer::Accept(const char* chars) {
    // A zero byte is in every set; the number or operator then ends with it.
    if (m_Char == Source::kEnd || !strchr(chars, m_Char)) return false;
    SaveAndStep();
    return true;
}

// At a bracket: how many equals signs stand before another one; else less than 0.
int Lexer::ReadEquals() {
    int bracket = m_Char;
    int count = 0;
    SaveAndStep();
    for (; m_Char == '='; count++) SaveAndStep();
    return m_Char == bracket ? count : -count - 1;
}

// The second bracket of "[==[" is the present character. Without `content` it is a comment.
void Lexer::ReadLongBracket(Content* content, int level) {
    SaveAndStep();
    if (IsLineEnd()) SkipLineEnd();
    for (;;) {
        switch (m_Char) {
            case Source::kEnd:
                FailNear(content ? "unfinished long string" : "unfinished long comment", TokenEnd_);
            case '[':
                if (ReadEquals() == level) {
                    SaveAndStep();
                    if (level == 0) FailNear("nesting of [[...]] is deprecated", '[');
                }
                break;
            case ']':
                if (ReadEquals() == level) {
                    SaveAndStep();
                    if (content) {
                        std::string_view text = m_Text;
                        text.remove_prefix(level + 2);
                        text.remove_suffix(level + 2);
                        content->m_String = Intern(text);
                    }
                    return;
                }
                break;
            case '\n':
            case '\r':
                Save('\n');
                SkipLineEnd();
                if (!content) m_Text.clear();
                break;
            default:
                if (content) Save(m_Char);
                Step();
        }
    }
}

void Lexer::ReadEscape() {
    Step();
    switch (m_Char) {
        case 'a':
            Save('\a');
            break;
        case 'b':
            Save('\b');
            break;
        case 'f':
            Save('\f');
            break;
        case 'n':
            Save('\n');
            break;
        case 'r':
            Save('\r');
            break;
        case 't':
            Save('\t');
            break;
        case 'v':
            Save('\v');
            break;
        case '\n':
        case '\r':
            Save('\n');
            SkipLineEnd();
            return;
        case Source::kEnd:
            return;  // the string's loop says so
        case 'x': {
            int value = 0;
            for (int i = 0; i < 2; i++) {
                Step();
                if (!IsHexDigit(m_Char)) FailNear("hexadecimal digit expected", TokenString);
                value = value * 16 + GetHexDigit(m_Char);
            }
            Save(value);
            break;
        }
        default: {
            if (!IsDigit(m_Char)) {
                Save(m_Char);
                break;
            }
            int value = 0;
            for (int i = 0; i < 3 && IsDigit(m_Char); i++) {
                value = value * 10 + (m_Char - '0');
                Step();
            }
            if (value > UCHAR_MAX) FailNear("escape sequence too large", TokenString);
            Save(value);
            return;
        }
    }
    Step();
}

void Lexer::ReadString(Content& content) {
    int quote = m_Char;
    SaveAndStep();
    while (m_Char != quote) {
        switch (m_Char) {
            case Source::kEnd:
                FailNear("unfinished string", TokenEnd_);
            case '\n':
            case '\r':
                FailNear("unfinished string", TokenString);
            case '\\':
                ReadEscape();
                break;
            default:
                SaveAndStep();
        }
    }
    SaveAndStep();
    content.m_String = Intern(std::string_view(m_Text).substr(1, m_Text.size() - 2));
}

void Lexer::ReadNumber(Content& content) {
    do {
        SaveAndStep();
    } while (IsDigit(m_Char) || m_Char == '.');
    if (Accept("Ee")) Accept("+-");
    while (IsWordChar(m_Char)) SaveAndStep();
    if (!ReadNumberText(m_Text, content.m_Number)) FailNear("malformed number", TokenNumber);
}

int Lexer::ReadName(Content& content) {
    do {
        SaveAndStep();
    } while (IsWordChar(m_Char));
    String* name = Intern(m_Text);
    content.m_String = name;
    return name->m_Extra ? TokenAnd - 1 + name->m_Extra : static_cast<int>(TokenName);
}

// Behind "--".
void Lexer::SkipComment() {
    Step();
    if (m_Char == '[') {
        int level = ReadEquals();
        m_Text.clear();
        if (level >= 0) {
            ReadLongBracket(nullptr, level);
            m_Text.clear();
            return;
        }
    }
    while (!IsLineEnd() && m_Char != Source::kEnd) Step();
}

int Lexer::Read(Content& content) {
    m_Text.clear();
    for (;;) {
        switch (m_Char) {
            case '\n':
            case '\r':
                SkipLineEnd();
                continue;
            case ' ':
            case '\t':
            case '\v':
            case '\f':
                Step();
                continue;
            case '-':
                Step();
                if (m_Char != '-') return '-';
                SkipComment();
                continue;
            case '[': {
                int level = ReadEquals();
                if (level >= 0) {
                    ReadLongBracket(&content, level);
                    return TokenString;
                }
                if (level == -1) return '[';
                FailNear("invalid long string delimiter", TokenString);
            }
            case '=':
                Step();
                if (m_Char != '=') return '=';
                Step();
                return TokenEqual;
            case '<':
                Step();
                if (m_Char != '=') return '<';
                Step();
                return TokenLessEqual;
            case '>':
                Step();
                if (m_Char != '=') return '>';
                Step();
                return TokenGreaterEqual;
            case '~':
                Step();
                if (m_Char != '=') return '~';
                Step();
                return TokenNotEqual;
            case '"':
            case '\'':
                ReadString(content);
                return TokenString;
            case '.':
                SaveAndStep();
                if (Accept(".")) return Accept(".") ? TokenDots : TokenConcat;
                if (!IsDigit(m_Char)) return '.';
                ReadNumber(content);
                return TokenNumber;
            case Source::kEnd:
                return TokenEnd_;
            default: {
                if (IsDigit(m_Char)) {
                    ReadNumber(content);
                    return TokenNumber;
                }
                if (IsWordChar(m_Char)) return ReadName(content);
                int c = m_Char;
                Step();
                return c;
            }
        }
    }
}

}  // namespace Korvel::TextForm

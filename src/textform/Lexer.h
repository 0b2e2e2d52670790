// Reads source text as tokens.
#pragma once

#include <string>

#include "textform/State.h"
#include "textform/Value.h"

namespace Korvel::TextForm {

// Tokens of one character are that character.
enum Token : int {
    TokenAnd = 257,
    TokenBreak,
    TokenDo,
    TokenElse,
    TokenElseif,
    TokenEnd,
    TokenFalse,
    TokenFor,
    TokenFunction,
    TokenIf,
    TokenIn,
    TokenLocal,
    TokenNil,
    TokenNot,
    TokenOr,
    TokenRepeat,
    TokenReturn,
    TokenThen,
    TokenTrue,
    TokenUntil,
    TokenWhile,
    TokenConcat,
    TokenDots,
    TokenEqual,
    TokenGreaterEqual,
    TokenLessEqual,
    TokenNotEqual,
    TokenNumber,
    TokenName,
    TokenString,
    TokenEnd_,  // of the text
};

// The bytes of a chunk, piece by piece as its reader gives them.
class Source {
public:
    static constexpr int kEnd = -1;

    Source(State& L, ChunkReader reader, void* readerState)
        : m_State(L), m_Reader(reader), m_ReaderState(readerState) {}

    int Get() { return m_Place < m_End ? static_cast<unsigned char>(*m_Place++) : Refill(); }
    int Peek() {
        int c = Get();
        if (c != kEnd) m_Place--;
        return c;
    }
    // Up to the end of the piece, for readers that look at many bytes at once.
    const char* GetPlace() const { return m_Place; }
    const char* GetEnd() const { return m_End; }
    void Advance(const char* place) { m_Place = place; }

private:
    int Refill();

    State& m_State;
    ChunkReader m_Reader;
    void* m_ReaderState;
    const char* m_Place = nullptr;
    const char* m_End = nullptr;
};

class Lexer {
public:
    Lexer(State& L, Source& source, String* chunkName);

    void Next();      // reads the next token
    int LookAhead();  // the token after the present one

    int GetToken() const { return m_Token.m_Kind; }
    double GetNumber() const { return m_Token.m_Number; }
    String* GetString() const { return m_Token.m_String; }
    int GetLine() const { return m_Line; }          // where the reading stands
    int GetLastLine() const { return m_LastLine; }  // where the token before the present one ended
    String* GetChunkName() const { return m_ChunkName; }
    State& GetState() const { return m_State; }

    // Raises an error at the present token.
    [[noreturn]] void Fail(const char* message);
    // Raises an error at a token; 0 names none.
    [[noreturn]] void FailNear(const char* message, int token);
    // A token as messages name it; pushed on the stack.
    const char* PushTokenName(int token);

private:
    struct Content {
        int m_Kind = 0;
        double m_Number = 0;
        String* m_String = nullptr;
    };

    int Read(Content& content);
    void Step() { m_Char = m_Source.Get(); }
    void Save(int c) { m_Text.push_back(static_cast<char>(c)); }
    void SaveAndStep() {
        Save(m_Char);
        Step();
    }
    bool IsLineEnd() const { return m_Char == '\n' || m_Char == '\r'; }
    void SkipLineEnd();
    bool Accept(const char* chars);
    int ReadEquals();
    void ReadLongBracket(Content* content, int level);
    void ReadString(Content& content);
    void ReadEscape();
    void ReadNumber(Content& content);
    int ReadName(Content& content);
    void SkipComment();
    String* Intern(std::string_view text);

    State& m_State;
    Source& m_Source;
    String* m_ChunkName;
    int m_Char;
    int m_Line = 1;
    int m_LastLine = 1;
    Content m_Token;
    Content m_Ahead;
    std::string m_Text;  // of the token being read
};

// The reserved words get their numbers, once for a machine.
void InitReservedWords(Machine& machine);

}  // namespace Korvel::TextForm

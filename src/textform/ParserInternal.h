#pragma once

#include "textform/Code.h"
#include "textform/Lexer.h"

namespace Korvel::TextForm {

// The left sides of an assignment, the last one first. Each stands on the parser's own stack.
struct Target {
    Target* m_Previous;
    Expression m_Variable;
};

// The items of a table constructor.
struct Constructor {
    Expression m_Table;
    Expression m_Item;  // the last list item, not stored yet
    int m_NamedCount = 0;
    int m_ListCount = 0;
    int m_ToStore = 0;  // list items in registers
};

class Parser {
public:
    Parser(State& L, Source& source, String* chunkName)
        : m_State(L), m_Lexer(L, source, chunkName) {}

    Prototype* ParseMain();

private:
    // Nested syntax counts like nested calls of native code, and has the same limit.
    class Level {
    public:
        explicit Level(Parser& parser) : m_Parser(parser) {
            if (++parser.m_State.m_NativeCalls > State::kMaxNativeCalls) {
                parser.m_State.m_NativeCalls--;
                parser.m_Lexer.FailNear("chunk has too many syntax levels", 0);
            }
        }
        Level(const Level&) = delete;
        Level& operator=(const Level&) = delete;
        ~Level() { m_Parser.m_State.m_NativeCalls--; }

    private:
        Parser& m_Parser;
    };

    // ---- Tokens
    int GetToken() const { return m_Lexer.GetToken(); }
    int GetLine() const { return m_Lexer.GetLine(); }
    void Next() { m_Lexer.Next(); }
    bool Accept(int token) {
        if (GetToken() != token) return false;
        Next();
        return true;
    }
    void Expect(int token) {
        Check(token);
        Next();
    }
    void Check(int token) {
        if (GetToken() != token) FailExpected(token);
    }
    [[noreturn]] void FailExpected(int token);
    void ExpectClosing(int what, int who, int line);
    String* ReadName();
    bool EndsBlock() const;

    // ---- Statements
    void ParseChunk();
    void ParseBlock();
    bool ParseStatement();
    void ParseIf(int line);
    int ParseThenBlock();
    void ParseWhile(int line);
    void ParseFor(int line);
    void ParseNumericFor(String* name, int line);
    void ParseGenericFor(String* name);
    void ParseForBody(int base, int line, int variableCount, bool isNumeric);
    void ParseRepeat(int line);
    void ParseFunction(int line);
    void ParseLocal();
    void ParseLocalFunction();
    void ParseReturn();
    void ParseBreak();
    void ParseExpressionStatement();
    void ParseAssignment(Target& target, int variableCount);
    void CheckConflict(Target* target, const Expression& local);
    void AdjustAssignment(int variableCount, int valueCount, Expression& last);

    // ---- Expressions
    void ParseExpression(Expression& e) { ParseSubexpression(e, 0); }
    BinaryOp ParseSubexpression(Expression& e, int limit);
    void ParseSimple(Expression& e);
    void ParsePrimary(Expression& e);
    void ParsePrefix(Expression& e);
    void ParseField(Expression& e);
    void ParseIndex(Expression& key);
    void ParseArguments(Expression& function);
    int ParseExpressionList(Expression& last);
    int ParseCondition();
    void ParseFunctionBody(Expression& e, bool isMethod, int line);
    void ParseParameters();
    void EmitClosure(FunctionCode& inner, Expression& e);
    void ParseConstructor(Expression& e);
    void ParseNamedField(Constructor& c);
    void ParseListItem(Constructor& c);
    void StorePendingItem(Constructor& c);
    void StoreLastItems(Constructor& c);
    void MakeConstant(Expression& e, String* text) {
        e = Expression(Expression::Constant, m_Code->AddString(text));
    }
    void FindVariable(Expression& e, String* name);
    Expression::Kind FindIn(FunctionCode* code, String* name, Expression& e, bool isInnermost);

    State& m_State;
    Lexer m_Lexer;
    FunctionCode* m_Code = nullptr;
};

}  // namespace Korvel::TextForm

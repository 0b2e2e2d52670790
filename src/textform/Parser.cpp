// The grammar of statements, by recursive descent; code is generated on the way. Expressions:
// Parser_Expressions.cpp.
#include "textform/Parser.h"

#include <algorithm>

#include "textform/ParserInternal.h"

namespace Korvel::TextForm {

// ---- Tokens

void Parser::FailExpected(int token) {
    m_Lexer.Fail(m_State.PushFormat("'%s' expected", m_Lexer.PushTokenName(token)));
}

void Parser::ExpectClosing(int what, int who, int line) {
    if (Accept(what)) return;
    if (line == GetLine()) FailExpected(what);
    m_Lexer.Fail(m_State.PushFormat("'%s' expected (to close '%s' at line %d)",
                                    m_Lexer.PushTokenName(what), m_Lexer.PushTokenName(who), line));
}

String* Parser::ReadName() {
    Check(TokenName);
    String* name = m_Lexer.GetString();
    Next();
    return name;
}

bool Parser::EndsBlock() const {
    switch (GetToken()) {
        case TokenElse:
        case TokenElseif:
        case TokenEnd:
        case TokenEnd_:
        case TokenUntil:
            return true;
        default:
            return false;
    }
}

// ---- Statements

void Parser::ParseBlock() {
    Block block;
    m_Code->EnterBlock(block, false);
    ParseChunk();
    m_Code->LeaveBlock();
}

// `a = b` with the local a among the tables or keys of other targets: those get a copy.
void Parser::CheckConflict(Target* target, const Expression& local) {
    int copy = m_Code->m_FreeRegister;
    bool conflicts = false;
    for (; target; target = target->m_Previous) {
        Expression& variable = target->m_Variable;
        if (variable.m_Kind != Expression::Indexed) continue;
        if (variable.m_Info == local.m_Info) {
            conflicts = true;
            variable.m_Info = copy;
        }
        if (variable.m_Aux == local.m_Info) {
            conflicts = true;
            variable.m_Aux = copy;
        }
    }
    if (!conflicts) return;
    m_Code->EmitABC(Op::Move, copy, local.m_Info, 0);
    m_Code->Reserve(1);
}

void Parser::AdjustAssignment(int variableCount, int valueCount, Expression& last) {
    int missing = variableCount - valueCount;
    if (last.IsMulti()) {
        missing = std::max(missing + 1, 0);  // the last one gives what is missing, and itself
        m_Code->SetResultCount(last, missing);
        if (missing > 1) m_Code->Reserve(missing - 1);
        return;
    }
    if (last.m_Kind != Expression::Void) m_Code->ToNextRegister(last);
    if (missing > 0) {
        int reg = m_Code->m_FreeRegister;
        m_Code->Reserve(missing);
        m_Code->EmitNil(reg, missing);
    }
}

void Parser::ParseAssignment(Target& target, int variableCount) {
    auto kind = target.m_Variable.m_Kind;
    if (kind < Expression::Local || kind > Expression::Indexed) m_Lexer.Fail("syntax error");
    Expression e;
    if (Accept(',')) {
        Target next{&target, {}};
        ParsePrimary(next.m_Variable);
        if (next.m_Variable.m_Kind == Expression::Local) CheckConflict(&target, next.m_Variable);
        m_Code->CheckLimit(variableCount, State::kMaxNativeCalls - m_State.m_NativeCalls,
                           "variables in assignment");
        ParseAssignment(next, variableCount + 1);
    } else {
        Expect('=');
        int valueCount = ParseExpressionList(e);
        if (valueCount == variableCount) {
            m_Code->SetOneResult(e);
            m_Code->Store(target.m_Variable, e);
            return;
        }
        AdjustAssignment(variableCount, valueCount, e);
        if (valueCount > variableCount) {
            m_Code->m_FreeRegister -= valueCount - variableCount;  // what nobody takes
        }
    }
    e = Expression(Expression::Register, m_Code->m_FreeRegister - 1);
    m_Code->Store(target.m_Variable, e);
}

int Parser::ParseCondition() {
    Expression e;
    ParseExpression(e);
    if (e.m_Kind == Expression::Nil) e.m_Kind = Expression::False;
    m_Code->JumpIfFalse(e);
    return e.m_FalseJumps;
}

void Parser::ParseBreak() {
    Block* block = m_Code->m_Block;
    bool hasUpValues = false;
    while (block && !block->m_IsLoop) {
        hasUpValues |= block->m_HasUpValues;
        block = block->m_Outer;
    }
    if (!block) m_Lexer.Fail("no loop to break");
    if (hasUpValues) m_Code->EmitABC(Op::Close, block->m_ActiveCount, 0, 0);
    m_Code->Join(block->m_BreakJumps, m_Code->EmitJump());
}

void Parser::ParseWhile(int line) {
    Next();
    int start = m_Code->MarkTarget();
    int exit = ParseCondition();
    Block block;
    m_Code->EnterBlock(block, true);
    Expect(TokenDo);
    ParseBlock();
    m_Code->PatchTo(m_Code->EmitJump(), start);
    ExpectClosing(TokenEnd, TokenWhile, line);
    m_Code->LeaveBlock();
    m_Code->PatchHere(exit);
}

void Parser::ParseRepeat(int line) {
    int start = m_Code->MarkTarget();
    Block loop;
    Block scope;
    m_Code->EnterBlock(loop, true);
    m_Code->EnterBlock(scope, false);
    Next();
    ParseChunk();
    ExpectClosing(TokenUntil, TokenRepeat, line);
    int exit = ParseCondition();  // sees the locals of the loop
    if (!scope.m_HasUpValues) {
        m_Code->LeaveBlock();
        m_Code->PatchTo(exit, start);
    } else {  // both ways close the up-values
        ParseBreak();
        m_Code->PatchHere(exit);
        m_Code->LeaveBlock();
        m_Code->PatchTo(m_Code->EmitJump(), start);
    }
    m_Code->LeaveBlock();
}

void Parser::ParseForBody(int base, int line, int variableCount, bool isNumeric) {
    m_Code->ActivateLocals(3);  // the loop's own
    Expect(TokenDo);
    int prepare = m_Code->EmitAsBx(isNumeric ? Op::ForPrep : Op::TForPrep, base, kNoJump);
    Block block;
    m_Code->EnterBlock(block, false);
    m_Code->ActivateLocals(variableCount);
    m_Code->Reserve(variableCount);
    ParseBlock();
    m_Code->LeaveBlock();
    m_Code->PatchHere(prepare);
    int end = isNumeric ? m_Code->EmitAsBx(Op::ForLoop, base, kNoJump)
                        : m_Code->EmitABC(Op::TForLoop, base, 0, variableCount);
    m_Code->SetLine(line);
    m_Code->PatchTo(isNumeric ? end : m_Code->EmitJump(), prepare + 1);
}

void Parser::ParseNumericFor(String* name, int line) {
    Machine& machine = m_State.GetMachine();
    int base = m_Code->m_FreeRegister;
    m_Code->DeclareLocal(machine.NewString("(for index)"), 0);
    m_Code->DeclareLocal(machine.NewString("(for limit)"), 1);
    m_Code->DeclareLocal(machine.NewString("(for step)"), 2);
    m_Code->DeclareLocal(name, 3);
    auto parseOne = [this] {
        Expression e;
        ParseExpression(e);
        m_Code->ToNextRegister(e);
    };
    Expect('=');
    parseOne();
    Expect(',');
    parseOne();
    if (Accept(',')) {
        parseOne();
    } else {
        m_Code->EmitWithConstant(Op::LoadK, m_Code->m_FreeRegister, m_Code->AddNumber(1));
        m_Code->Reserve(1);
    }
    ParseForBody(base, line, 1, true);
}

void Parser::ParseGenericFor(String* name) {
    Machine& machine = m_State.GetMachine();
    int base = m_Code->m_FreeRegister;
    int count = 0;
    m_Code->DeclareLocal(machine.NewString("(for generator)"), count++);
    m_Code->DeclareLocal(machine.NewString("(for state)"), count++);
    m_Code->DeclareLocal(machine.NewString("(for control)"), count++);
    m_Code->DeclareLocal(name, count++);
    while (Accept(',')) m_Code->DeclareLocal(ReadName(), count++);
    Expect(TokenIn);
    int line = GetLine();
    Expression last;
    int valueCount = ParseExpressionList(last);
    AdjustAssignment(3, valueCount, last);
    if (valueCount > 3) m_Code->m_FreeRegister -= valueCount - 3;
    m_Code->CheckStack(3);  // for the call of the generator
    ParseForBody(base, line, count - 3, false);
}

void Parser::ParseFor(int line) {
    Block block;
    m_Code->EnterBlock(block, true);
    Next();
    String* name = ReadName();
    switch (GetToken()) {
        case '=':
            ParseNumericFor(name, line);
            break;
        case ',':
        case TokenIn:
            ParseGenericFor(name);
            break;
        default:
            m_Lexer.Fail("'=' or 'in' expected");
    }
    ExpectClosing(TokenEnd, TokenFor, line);
    m_Code->LeaveBlock();
}

int Parser::ParseThenBlock() {
    Next();
    int exit = ParseCondition();
    Expect(TokenThen);
    ParseBlock();
    return exit;
}

void Parser::ParseIf(int line) {
    int escapes = kNoJump;
    int otherwise = ParseThenBlock();
    while (GetToken() == TokenElseif) {
        m_Code->Join(escapes, m_Code->EmitJump());
        m_Code->PatchHere(otherwise);
        otherwise = ParseThenBlock();
    }
    if (GetToken() == TokenElse) {
        m_Code->Join(escapes, m_Code->EmitJump());
        m_Code->PatchHere(otherwise);
        Next();
        ParseBlock();
    } else {
        m_Code->Join(escapes, otherwise);
    }
    m_Code->PatchHere(escapes);
    ExpectClosing(TokenEnd, TokenIf, line);
}

void Parser::ParseLocalFunction() {
    m_Code->DeclareLocal(ReadName(), 0);
    Expression variable(Expression::Local, m_Code->m_FreeRegister);
    m_Code->Reserve(1);
    m_Code->ActivateLocals(1);  // so that the function can call itself
    Expression body;
    ParseFunctionBody(body, false, GetLine());
    m_Code->Store(variable, body);
    m_Code->GetLocal(m_Code->m_ActiveCount - 1).m_StartPc = m_Code->m_Pc;
}

void Parser::ParseLocal() {
    int count = 0;
    do {
        m_Code->DeclareLocal(ReadName(), count++);
    } while (Accept(','));
    Expression last;
    int valueCount = Accept('=') ? ParseExpressionList(last) : 0;
    AdjustAssignment(count, valueCount, last);
    if (valueCount > count) m_Code->m_FreeRegister -= valueCount - count;
    m_Code->ActivateLocals(count);
}

void Parser::ParseFunction(int line) {
    Next();
    Expression variable;
    FindVariable(variable, ReadName());
    while (GetToken() == '.') ParseField(variable);
    bool isMethod = GetToken() == ':';
    if (isMethod) ParseField(variable);
    Expression body;
    ParseFunctionBody(body, isMethod, line);
    m_Code->Store(variable, body);
    m_Code->SetLine(line);
}

void Parser::ParseReturn() {
    Next();
    int first = 0;
    int count = 0;
    if (!EndsBlock() && GetToken() != ';') {
        Expression e;
        count = ParseExpressionList(e);
        if (e.IsMulti()) {
            m_Code->SetResultCount(e, kAllResults);
            if (e.m_Kind == Expression::Call && count == 1) {
                SetOp(m_Code->At(e), Op::TailCall);
            }
            first = m_Code->m_ActiveCount;
            count = kAllResults;
        } else if (count == 1) {
            first = m_Code->ToAnyRegister(e);
        } else {
            m_Code->ToNextRegister(e);
            first = m_Code->m_ActiveCount;
        }
    }
    m_Code->EmitReturn(first, count);
}

void Parser::ParseExpressionStatement() {
    Target target{nullptr, {}};
    ParsePrimary(target.m_Variable);
    if (target.m_Variable.m_Kind == Expression::Call) {
        SetC(m_Code->At(target.m_Variable), 1);  // no results
    } else {
        ParseAssignment(target, 1);
    }
}

// True for a statement that must be the last of its block.
bool Parser::ParseStatement() {
    int line = GetLine();
    switch (GetToken()) {
        case TokenIf:
            ParseIf(line);
            return false;
        case TokenWhile:
            ParseWhile(line);
            return false;
        case TokenDo:
            Next();
            ParseBlock();
            ExpectClosing(TokenEnd, TokenDo, line);
            return false;
        case TokenFor:
            ParseFor(line);
            return false;
        case TokenRepeat:
            ParseRepeat(line);
            return false;
        case TokenFunction:
            ParseFunction(line);
            return false;
        case TokenLocal:
            Next();
            if (Accept(TokenFunction)) {
                ParseLocalFunction();
            } else {
                ParseLocal();
            }
            return false;
        case TokenReturn:
            ParseReturn();
            return true;
        case TokenBreak:
            Next();
            ParseBreak();
            return true;
        default:
            ParseExpressionStatement();
            return false;
    }
}

void Parser::ParseChunk() {
    Level level(*this);
    bool isLast = false;
    while (!isLast && !EndsBlock()) {
        isLast = ParseStatement();
        Accept(';');
        m_Code->m_FreeRegister = m_Code->m_ActiveCount;
    }
}

Prototype* Parser::ParseMain() {
    FunctionCode main(m_Lexer, nullptr);
    m_Code = &main;
    main.m_Prototype->m_VarargFlags = Prototype::kIsVararg;
    Next();
    ParseChunk();
    Check(TokenEnd_);
    main.Finish();
    return main.m_Prototype;
}

Prototype* Parse(State& L, Source& source, const char* chunkName) {
    String* name = L.GetMachine().NewString(chunkName);
    return Parser(L, source, name).ParseMain();
}

}  // namespace Korvel::TextForm

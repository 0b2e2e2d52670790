// The grammar of expressions: variables, calls, constructors, functions, operators.
#include "textform/ParserInternal.h"

namespace Korvel::TextForm {

namespace {

struct Priority {
    int m_Left;
    int m_Right;  // lower than left where an operator associates to the right
};
constexpr Priority kPriorities[] = {
    {6, 6},  {6, 6}, {7, 7}, {7, 7}, {7, 7},          // + - * / %
    {10, 9}, {5, 4},                                  // ^ ..
    {3, 3},  {3, 3}, {3, 3}, {3, 3}, {3, 3}, {3, 3},  // ~= == < <= > >=
    {2, 2},  {1, 1},                                  // and or
};
constexpr int kUnaryPriority = 8;

BinaryOp GetBinaryOp(int token) {
    switch (token) {
        case '+':
            return BinaryOp::Add;
        case '-':
            return BinaryOp::Sub;
        case '*':
            return BinaryOp::Mul;
        case '/':
            return BinaryOp::Div;
        case '%':
            return BinaryOp::Mod;
        case '^':
            return BinaryOp::Pow;
        case TokenConcat:
            return BinaryOp::Concat;
        case TokenNotEqual:
            return BinaryOp::NotEqual;
        case TokenEqual:
            return BinaryOp::Equal;
        case '<':
            return BinaryOp::Less;
        case TokenLessEqual:
            return BinaryOp::LessEqual;
        case '>':
            return BinaryOp::Greater;
        case TokenGreaterEqual:
            return BinaryOp::GreaterEqual;
        case TokenAnd:
            return BinaryOp::And;
        case TokenOr:
            return BinaryOp::Or;
        default:
            return BinaryOp::None;
    }
}

UnaryOp GetUnaryOp(int token) {
    switch (token) {
        case '-':
            return UnaryOp::Minus;
        case TokenNot:
            return UnaryOp::Not;
        case '#':
            return UnaryOp::Length;
        default:
            return UnaryOp::None;
    }
}

// A size hint in 8 bits: xxxxxyyy stands for 1yyy shifted left by xxxxx - 1.
int EncodeSizeHint(unsigned size) {
    int exponent = 0;
    while (size >= 16) {
        size = (size + 1) >> 1;
        exponent++;
    }
    return size < 8 ? static_cast<int>(size) : (exponent + 1) << 3 | (static_cast<int>(size) - 8);
}

}  // namespace

// ---- Variables

Expression::Kind Parser::FindIn(FunctionCode* code, String* name, Expression& e, bool isInnermost) {
    if (!code) {
        e = Expression(Expression::Global, 0);
        return e.m_Kind;
    }
    m_State.Charge(static_cast<size_t>(code->m_ActiveCount) / 64);
    int local = code->FindLocal(name);
    if (local >= 0) {
        e = Expression(Expression::Local, local);
        if (!isInnermost) code->MarkUpValue(local);
        return e.m_Kind;
    }
    if (FindIn(code->m_Outer, name, e, false) != Expression::Global) {
        e = Expression(Expression::UpValue, code->FindUpValue(name, e));
    }
    return e.m_Kind;
}

void Parser::FindVariable(Expression& e, String* name) {
    if (FindIn(m_Code, name, e, true) == Expression::Global) e.m_Info = m_Code->AddString(name);
}

// ---- Expressions

void Parser::ParseField(Expression& e) {
    m_Code->ToAnyRegister(e);
    Next();
    Expression key;
    MakeConstant(key, ReadName());
    m_Code->MakeIndexed(e, key);
}

void Parser::ParseIndex(Expression& key) {
    Next();
    ParseExpression(key);
    m_Code->ToValue(key);
    Expect(']');
}

void Parser::StorePendingItem(Constructor& c) {
    if (c.m_Item.m_Kind == Expression::Void) return;
    m_Code->ToNextRegister(c.m_Item);
    c.m_Item.m_Kind = Expression::Void;
    if (c.m_ToStore < kFieldsPerFlush) return;
    m_Code->EmitSetList(c.m_Table.m_Info, c.m_ListCount, c.m_ToStore);
    c.m_ToStore = 0;
}

void Parser::StoreLastItems(Constructor& c) {
    if (c.m_ToStore == 0) return;
    if (c.m_Item.IsMulti()) {
        m_Code->SetResultCount(c.m_Item, kAllResults);
        m_Code->EmitSetList(c.m_Table.m_Info, c.m_ListCount, kAllResults);
        c.m_ListCount--;  // not for the hint: how many there will be is not known
        return;
    }
    if (c.m_Item.m_Kind != Expression::Void) m_Code->ToNextRegister(c.m_Item);
    m_Code->EmitSetList(c.m_Table.m_Info, c.m_ListCount, c.m_ToStore);
}

void Parser::ParseNamedField(Constructor& c) {
    int firstFree = m_Code->m_FreeRegister;
    Expression key;
    if (GetToken() == TokenName) {
        m_Code->CheckLimit(c.m_NamedCount, INT32_MAX - 2, "items in a constructor");
        MakeConstant(key, ReadName());
    } else {
        ParseIndex(key);
    }
    c.m_NamedCount++;
    Expect('=');
    int keyOperand = m_Code->ToOperand(key);
    Expression value;
    ParseExpression(value);
    m_Code->EmitABC(Op::SetTable, c.m_Table.m_Info, keyOperand, m_Code->ToOperand(value));
    m_Code->m_FreeRegister = firstFree;
}

void Parser::ParseListItem(Constructor& c) {
    ParseExpression(c.m_Item);
    m_Code->CheckLimit(c.m_ListCount, INT32_MAX - 2, "items in a constructor");
    c.m_ListCount++;
    c.m_ToStore++;
}

void Parser::ParseConstructor(Expression& e) {
    int line = GetLine();
    int braceLine = line;  // void behind the first field
    bool isCompact = false;
    int pc = m_Code->EmitABC(Op::NewTable, 0, 0, 0);
    Constructor c;
    e = Expression(Expression::Relocatable, pc);
    m_Code->ToNextRegister(e);
    c.m_Table = e;
    Expect('{');
    while (GetToken() != '}') {
        StorePendingItem(c);
        bool isNamed = GetToken() == '[' || (GetToken() == TokenName && m_Lexer.LookAhead() == '=');
        if (isNamed) {
            ParseNamedField(c);
        } else {
            ParseListItem(c);
        }
        if (GetLine() == braceLine) isCompact = true;
        braceLine = -1;
        if (!Accept(',') && !Accept(';')) break;
    }
    ExpectClosing('}', '{', line);
    StoreLastItems(c);
    SetB(m_Code->At(pc), EncodeSizeHint(c.m_ListCount) | (isCompact ? kCompactBit : 0));
    SetC(m_Code->At(pc), EncodeSizeHint(c.m_NamedCount));
}

void Parser::ParseParameters() {
    FunctionCode& code = *m_Code;
    Prototype* p = code.m_Prototype;
    int count = 0;
    p->m_VarargFlags = 0;
    if (GetToken() != ')') {
        do {
            if (GetToken() == TokenName) {
                code.DeclareLocal(ReadName(), count++);
            } else if (Accept(TokenDots)) {
                code.DeclareLocal(m_State.GetMachine().NewString("arg"), count++);
                p->m_VarargFlags = Prototype::kHasArg | Prototype::kNeedsArg | Prototype::kIsVararg;
            } else {
                m_Lexer.Fail("<name> or '...' expected");
            }
        } while (!p->m_VarargFlags && Accept(','));
    }
    code.ActivateLocals(count);
    p->m_ParameterCount =
        static_cast<uint8_t>(code.m_ActiveCount - (p->m_VarargFlags & Prototype::kHasArg));
    code.Reserve(code.m_ActiveCount);
}

// The instruction that makes the closure, and one for each variable that it takes along.
void Parser::EmitClosure(FunctionCode& inner, Expression& e) {
    int index = m_Code->AddPrototype(inner.m_Prototype);
    e = Expression(Expression::Relocatable, m_Code->EmitABx(Op::Closure, 0, index));
    for (int i = 0; i < inner.m_Prototype->m_UpValueCount; i++) {
        const auto& source = inner.m_UpValues[i];
        Op op = source.m_Kind == Expression::Local ? Op::Move : Op::GetUpVal;
        m_Code->EmitABC(op, 0, source.m_Info, 0);
    }
}

void Parser::ParseFunctionBody(Expression& e, bool isMethod, int line) {
    FunctionCode inner(m_Lexer, m_Code);
    m_Code = &inner;
    inner.m_Prototype->m_LineDefined = line;
    Expect('(');
    if (isMethod) {
        inner.DeclareLocal(m_State.GetMachine().NewString("self"), 0);
        inner.ActivateLocals(1);
    }
    ParseParameters();
    Expect(')');
    ParseChunk();
    inner.m_Prototype->m_LastLineDefined = GetLine();
    ExpectClosing(TokenEnd, TokenFunction, line);
    inner.Finish();
    m_Code = inner.m_Outer;
    EmitClosure(inner, e);
}

int Parser::ParseExpressionList(Expression& last) {
    int count = 1;
    ParseExpression(last);
    for (; Accept(','); count++) {
        m_Code->ToNextRegister(last);
        ParseExpression(last);
    }
    return count;
}

void Parser::ParseArguments(Expression& function) {
    Expression args;
    int line = GetLine();
    switch (GetToken()) {
        case '(':
            if (line != m_Lexer.GetLastLine()) {
                m_Lexer.Fail("ambiguous syntax (function call x new statement)");
            }
            Next();
            if (GetToken() != ')') {
                ParseExpressionList(args);
                m_Code->SetResultCount(args, kAllResults);
            }
            ExpectClosing(')', '(', line);
            break;
        case '{':
            ParseConstructor(args);
            break;
        case TokenString:
            MakeConstant(args, m_Lexer.GetString());
            Next();
            break;
        default:
            m_Lexer.Fail("function arguments expected");
    }
    int base = function.m_Info;
    int count = kAllResults;
    if (!args.IsMulti()) {
        if (args.m_Kind != Expression::Void) m_Code->ToNextRegister(args);
        count = m_Code->m_FreeRegister - (base + 1);
    }
    function = Expression(Expression::Call, m_Code->EmitABC(Op::Call, base, count + 1, 2));
    m_Code->SetLine(line);
    m_Code->m_FreeRegister = base + 1;  // the call leaves one value, unless told otherwise
}

void Parser::ParsePrefix(Expression& e) {
    switch (GetToken()) {
        case '(': {
            int line = GetLine();
            Next();
            ParseExpression(e);
            ExpectClosing(')', '(', line);
            m_Code->Discharge(e);
            return;
        }
        case TokenName:
            FindVariable(e, ReadName());
            return;
        default:
            m_Lexer.Fail("unexpected symbol");
    }
}

void Parser::ParsePrimary(Expression& e) {
    ParsePrefix(e);
    for (;;) {
        switch (GetToken()) {
            case '.':
                ParseField(e);
                break;
            case '[': {
                m_Code->ToAnyRegister(e);
                Expression key;
                ParseIndex(key);
                m_Code->MakeIndexed(e, key);
                break;
            }
            case ':': {
                Next();
                Expression key;
                MakeConstant(key, ReadName());
                m_Code->EmitSelf(e, key);
                ParseArguments(e);
                break;
            }
            case '(':
            case TokenString:
            case '{':
                m_Code->ToNextRegister(e);
                ParseArguments(e);
                break;
            default:
                return;
        }
    }
}

void Parser::ParseSimple(Expression& e) {
    switch (GetToken()) {
        case TokenNumber:
            e = Expression(Expression::Number, 0);
            e.m_Number = m_Lexer.GetNumber();
            break;
        case TokenString:
            MakeConstant(e, m_Lexer.GetString());
            break;
        case TokenNil:
            e = Expression(Expression::Nil, 0);
            break;
        case TokenTrue:
            e = Expression(Expression::True, 0);
            break;
        case TokenFalse:
            e = Expression(Expression::False, 0);
            break;
        case TokenDots: {
            Prototype* p = m_Code->m_Prototype;
            if (!p->m_VarargFlags) {
                m_Lexer.Fail("cannot use '...' outside a vararg function");
            }
            p->m_VarargFlags &= static_cast<uint8_t>(~Prototype::kNeedsArg);
            e = Expression(Expression::Vararg, m_Code->EmitABC(Op::Vararg, 0, 1, 0));
            break;
        }
        case '{':
            ParseConstructor(e);
            return;
        case TokenFunction:
            Next();
            ParseFunctionBody(e, false, GetLine());
            return;
        default:
            ParsePrimary(e);
            return;
    }
    Next();
}

// Reads operators that bind stronger than `limit`; returns the first one that does not.
BinaryOp Parser::ParseSubexpression(Expression& e, int limit) {
    Level level(*this);
    UnaryOp unary = GetUnaryOp(GetToken());
    if (unary != UnaryOp::None) {
        Next();
        e = {};
        ParseSubexpression(e, kUnaryPriority);
        m_Code->EmitUnary(unary, e);
    } else {
        e = {};
        ParseSimple(e);
    }
    BinaryOp op = GetBinaryOp(GetToken());
    while (op != BinaryOp::None && kPriorities[static_cast<int>(op)].m_Left > limit) {
        Next();
        m_Code->PrepareBinary(op, e);
        Expression right;
        BinaryOp next = ParseSubexpression(right, kPriorities[static_cast<int>(op)].m_Right);
        m_Code->EmitBinary(op, e, right);
        op = next;
    }
    return op;
}

}  // namespace Korvel::TextForm

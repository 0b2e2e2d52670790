// find, match, gmatch and gsub.
#include <algorithm>
#include <string>

#include "textform/Chars.h"
#include "textform/Pattern.h"
#include "textform/StringLibInternal.h"

namespace Korvel::TextForm {

namespace {

int Search(State& L, bool isFind) {
    String* text = L.CheckString(1);
    String* pattern = L.CheckString(2);
    auto length = static_cast<int64_t>(text->m_Length);
    int64_t start = GetPosition(L.OptInteger(3, 1), text->m_Length) - 1;
    start = std::clamp<int64_t>(start, 0, length);
    if (isFind && (!L.Arg(4).IsFalse() && L.GetArgType(4) != Type::None)) {
        start = static_cast<int64_t>(text->GetView().find(pattern->GetView(), start));
    } else if (isFind && !strpbrk(pattern->GetText(), "^$*+?.([%-")) {
        start = static_cast<int64_t>(text->GetView().find(pattern->GetView(), start));
    } else {
        const char* p = pattern->GetText();
        bool isAnchored = *p == '^';
        Matcher matcher(L, text->GetView(), p + isAnchored);
        const char* s = matcher.GetBegin() + start;
        do {
            const char* end = matcher.Match(s);
            if (!end) continue;
            if (!isFind) return matcher.PushCaptures(s, end);
            L.PushNumber(static_cast<double>(s - matcher.GetBegin() + 1));
            L.PushNumber(static_cast<double>(end - matcher.GetBegin()));
            return matcher.PushCaptures(nullptr, nullptr) + 2;
        } while (s++ < matcher.GetEnd() && !isAnchored);
        start = -1;
    }
    if (start < 0) {
        L.PushNil();
        return 1;
    }
    L.PushNumber(static_cast<double>(start + 1));
    L.PushNumber(static_cast<double>(start) + static_cast<double>(pattern->m_Length));
    return 2;
}

// Up-values: the text, the pattern and where to go on.
int GmatchStep(State& L) {
    NativeClosure* self = AsNative(L.m_Call->m_Function->AsFunction());
    Value* upValues = self->GetUpValues();
    Matcher matcher(L, upValues[0].AsString()->GetView(), upValues[1].AsString()->GetText());
    for (const char* s = matcher.GetBegin() + static_cast<size_t>(upValues[2].m_Number);
         s <= matcher.GetEnd(); s++) {
        const char* end = matcher.Match(s);
        if (!end) continue;
        ptrdiff_t next = end - matcher.GetBegin();
        if (end == s) next++;  // an empty match: go on at the next character
        upValues[2] = Value::Number(static_cast<double>(next));
        return matcher.PushCaptures(s, end);
    }
    return 0;
}

void AppendReplacement(State& L, Matcher& matcher, std::string& result, String* replacement,
                       const char* begin, const char* end) {
    const char* text = replacement->GetText();
    for (size_t i = 0; i < replacement->m_Length; i++) {
        if (text[i] != '%') {
            result.push_back(text[i]);
            continue;
        }
        i++;
        if (!IsDigit(static_cast<unsigned char>(text[i]))) {
            result.push_back(text[i]);
        } else if (text[i] == '0') {
            result.append(begin, end);
        } else {
            matcher.PushCapture(text[i] - '1', begin, end);
            L.ToString(L.m_Top - 1);
            result.append(L.m_Top[-1].AsString()->GetView());
            L.Pop();
        }
    }
}

// What stands for one match: from a text, a table or a function.
void AppendMatch(State& L, Matcher& matcher, std::string& result, const char* begin,
                 const char* end) {
    switch (L.GetArgType(3)) {
        case Type::Function: {
            L.Push(L.Arg(3));
            int count = matcher.PushCaptures(begin, end);
            L.Call(count, 1);
            break;
        }
        case Type::Table:
            matcher.PushCapture(0, begin, end);
            L.GetIndex(L.Arg(3), L.m_Top[-1], L.m_Top - 1);
            break;
        default:
            AppendReplacement(L, matcher, result, L.Arg(3).AsString(), begin, end);
            return;
    }
    Value* value = L.m_Top - 1;
    if (value->IsFalse()) {
        result.append(begin, end);
    } else if (L.ToString(value)) {
        result.append(value->AsString()->GetView());
    } else {
        L.Error("invalid replacement value (a %s)", GetTypeName(value->m_Type));
    }
    L.Pop();
}

}  // namespace

int StringFind(State& L) {
    return Search(L, true);
}

int StringMatch(State& L) {
    return Search(L, false);
}

int StringGmatch(State& L) {
    L.CheckString(1);
    L.CheckString(2);
    L.SetTop(2);
    L.PushNumber(0);
    L.PushFunction(GmatchStep, 3);
    return 1;
}

int StringGsub(State& L) {
    String* text = L.CheckString(1);
    const char* p = L.CheckString(2)->GetText();
    Type type = L.GetArgType(3);
    auto limit = static_cast<int>(L.OptInteger(4, static_cast<int64_t>(text->m_Length) + 1));
    if (type == Type::Number) {
        L.CheckString(3);
    } else if (type != Type::String && type != Type::Table && type != Type::Function) {
        L.ArgError(3, "string/function/table expected");
    }
    bool isAnchored = *p == '^';
    Matcher matcher(L, text->GetView(), p + isAnchored);
    std::string result;
    const char* s = matcher.GetBegin();
    int count = 0;
    while (count < limit) {
        const char* end = matcher.Match(s);
        if (end) {
            count++;
            AppendMatch(L, matcher, result, s, end);
        }
        if (end && end > s) {
            s = end;
        } else if (s < matcher.GetEnd()) {
            result.push_back(*s++);
        } else {
            break;
        }
        if (isAnchored) break;
    }
    result.append(s, matcher.GetEnd());
    L.PushString(result);
    L.PushNumber(count);
    return 2;
}

}  // namespace Korvel::TextForm

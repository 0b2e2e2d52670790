// string.format, through the C library with each directive checked first.
#include <clocale>
#include <cstdio>
#include <cstring>
#include <string>

#include "textform/Chars.h"
#include "textform/StringLibInternal.h"

namespace Korvel::TextForm {

namespace {

constexpr size_t kMaxItem = 512;  // the longest is "%99.99f" of the greatest number
constexpr const char* kFlags = "-+ #0";

// One directive as the C library takes it, with the size of integers filled in.
struct Directive {
    char m_Text[16];
    char m_Letter;
    bool m_HasPrecision;
};

const char* ReadDirective(State& L, const char* p, Directive& directive) {
    const char* begin = p;
    while (*p && strchr(kFlags, *p)) p++;
    if (static_cast<size_t>(p - begin) > strlen(kFlags)) {
        L.Error("invalid format (repeated flags)");
    }
    auto skipDigits = [&] {
        for (int i = 0; i < 2 && IsDigit(static_cast<unsigned char>(*p)); i++) p++;
    };
    skipDigits();
    directive.m_HasPrecision = *p == '.';
    if (*p == '.') {
        p++;
        skipDigits();
    }
    if (IsDigit(static_cast<unsigned char>(*p))) {
        L.Error("invalid format (width or precision too long)");
    }
    char* out = directive.m_Text;
    *out++ = '%';
    out = std::copy(begin, p, out);
    directive.m_Letter = *p;
    if (*p && strchr("diouxX", *p)) *out++ = 'l';
    *out++ = *p;
    *out = 0;
    return p + 1;
}

// As the processor converts, what is out of range too.
unsigned long ToUnsigned(double number) {
    constexpr double kTop = 9223372036854775808.0;
    if (!(number >= kTop)) return static_cast<unsigned long>(ToInt64(number));
    return static_cast<unsigned long>(ToInt64(number - kTop)) ^ 1ul << 63;
}

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
template <class T>
void AppendFormatted(std::string& result, const Directive& directive, T value) {
    char buffer[kMaxItem];
    snprintf(buffer, sizeof buffer, directive.m_Text, value);
    result.append(buffer);
}

void AppendNumber(std::string& result, const Directive& directive, double number) {
    char buffer[kMaxItem];
    snprintf(buffer, sizeof buffer, directive.m_Text, number);
    const char* point = localeconv()->decimal_point;
    char* found = strcmp(point, ".") ? strstr(buffer, point) : nullptr;
    if (!found) {
        result.append(buffer);
        return;
    }
    result.append(buffer, found);
    result.push_back('.');
    result.append(found + strlen(point));
}
#pragma GCC diagnostic pop

void AppendQuoted(std::string& result, std::string_view text) {
    result.push_back('"');
    for (char c : text) {
        switch (c) {
            case '"':
            case '\\':
            case '\n':
                result.push_back('\\');
                result.push_back(c);
                break;
            case '\r':
                result.append("\\r");
                break;
            case '\0':
                result.append("\\000");
                break;
            default:
                result.push_back(c);
        }
    }
    result.push_back('"');
}

void AppendItem(State& L, std::string& result, const Directive& directive, int arg) {
    switch (directive.m_Letter) {
        case 'c':
            AppendFormatted(result, directive, static_cast<int>(ToInt64(L.CheckNumber(arg))));
            break;
        case 'd':
        case 'i':
            AppendFormatted(result, directive, static_cast<long>(ToInt64(L.CheckNumber(arg))));
            break;
        case 'o':
        case 'u':
        case 'x':
        case 'X':
            AppendFormatted(result, directive, ToUnsigned(L.CheckNumber(arg)));
            break;
        case 'e':
        case 'E':
        case 'f':
        case 'g':
        case 'G':
            AppendNumber(result, directive, L.CheckNumber(arg));
            break;
        case 'q':
            AppendQuoted(result, L.CheckString(arg)->GetView());
            break;
        case 's': {
            String* text = L.CheckString(arg);
            if (!directive.m_HasPrecision && text->m_Length >= 100) {
                result.append(text->GetView());  // no width reaches it
            } else {
                AppendFormatted(result, directive, text->GetText());
            }
            break;
        }
        default:
            L.Error("invalid option '%%%c' to 'format'", directive.m_Letter);
    }
}

}  // namespace

int StringFormat(State& L) {
    String* format = L.CheckString(1);
    const char* p = format->GetText();
    const char* end = p + format->m_Length;
    std::string result;
    int arg = 1;
    while (p < end) {
        if (*p != '%') {
            result.push_back(*p++);
        } else if (p[1] == '%') {
            result.push_back('%');
            p += 2;
        } else {
            Directive directive;
            if (++arg > L.GetArgCount()) L.ArgError(arg, "no value");
            p = ReadDirective(L, p + 1, directive);
            AppendItem(L, result, directive, arg);
        }
    }
    L.PushString(result);
    return 1;
}

}  // namespace Korvel::TextForm

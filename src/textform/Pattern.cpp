#include "textform/Pattern.h"

#include "textform/Chars.h"

namespace Korvel::TextForm {

namespace {

constexpr char kEscape = '%';

int AsByte(char c) {
    return static_cast<unsigned char>(c);
}

}  // namespace

// The end of a single item: a character, a class or a set.
const char* Matcher::FindItemEnd(const char* p) {
    char first = *p++;
    if (first == kEscape) {
        if (*p == 0) m_State.Error("malformed pattern (ends with '%%')");
        return p + 1;
    }
    if (first != '[') return p;
    if (*p == '^') p++;
    do {  // a bracket in the first place belongs to the set
        if (*p == 0) m_State.Error("malformed pattern (missing ']')");
        if (*p++ == kEscape && *p != 0) p++;
    } while (*p != ']');
    return p + 1;
}

bool Matcher::MatchClass(int c, int letter) {
    bool result;
    switch (ToLower(letter)) {
        case 'a':
            result = IsLetter(c);
            break;
        case 'c':
            result = IsControl(c);
            break;
        case 'd':
            result = IsDigit(c);
            break;
        case 'l':
            result = IsLower(c);
            break;
        case 'p':
            result = IsPunctuation(c);
            break;
        case 's':
            result = IsSpace(c);
            break;
        case 'u':
            result = IsUpper(c);
            break;
        case 'w':
            result = IsAlphanumeric(c);
            break;
        case 'x':
            result = IsHexDigit(c);
            break;
        case 'z':
            result = c == 0;
            break;
        default:
            return letter == c;
    }
    return IsUpper(letter) ? !result : result;
}

// `p` is at the opening bracket, `setEnd` at the closing one.
bool Matcher::MatchSet(int c, const char* p, const char* setEnd) {
    bool found = true;
    if (p[1] == '^') {
        found = false;
        p++;
    }
    while (++p < setEnd) {
        if (*p == kEscape) {
            p++;
            if (MatchClass(c, AsByte(*p))) return found;
        } else if (p[1] == '-' && p + 2 < setEnd) {
            p += 2;
            if (AsByte(p[-2]) <= c && c <= AsByte(*p)) return found;
        } else if (AsByte(*p) == c) {
            return found;
        }
    }
    return !found;
}

bool Matcher::MatchSingle(int c, const char* p, const char* itemEnd) {
    switch (*p) {
        case '.':
            return true;
        case kEscape:
            return MatchClass(c, AsByte(p[1]));
        case '[':
            return MatchSet(c, p, itemEnd - 1);
        default:
            return AsByte(*p) == c;
    }
}

const char* Matcher::MatchBalance(const char* s, const char* p) {
    if (p[0] == 0 || p[1] == 0) m_State.Error("unbalanced pattern");
    if (s >= m_End || *s != p[0]) return nullptr;
    int depth = 1;
    while (++s < m_End) {
        if (*s == p[1]) {
            if (--depth == 0) return s + 1;
        } else if (*s == p[0]) {
            depth++;
        }
    }
    return nullptr;
}

const char* Matcher::ExpandMost(const char* s, const char* p, const char* itemEnd) {
    ptrdiff_t count = 0;
    while (s + count < m_End && MatchSingle(AsByte(s[count]), p, itemEnd)) count++;
    for (; count >= 0; count--) {
        if (const char* end = Match(s + count, itemEnd + 1)) return end;
    }
    return nullptr;
}

const char* Matcher::ExpandLeast(const char* s, const char* p, const char* itemEnd) {
    for (;; s++) {
        if (const char* end = Match(s, itemEnd + 1)) return end;
        if (s >= m_End || !MatchSingle(AsByte(*s), p, itemEnd)) return nullptr;
    }
}

const char* Matcher::OpenCapture(const char* s, const char* p, ptrdiff_t kind) {
    if (m_Level >= kMaxCaptures) m_State.Error("too many captures");
    m_Captures[m_Level++] = {s, kind};
    const char* end = Match(s, p);
    if (!end) m_Level--;
    return end;
}

const char* Matcher::CloseCapture(const char* s, const char* p) {
    int i = m_Level - 1;
    while (i >= 0 && m_Captures[i].m_Length != kUnfinished) i--;
    if (i < 0) m_State.Error("invalid pattern capture");
    m_Captures[i].m_Length = s - m_Captures[i].m_Begin;
    const char* end = Match(s, p);
    if (!end) m_Captures[i].m_Length = kUnfinished;
    return end;
}

int Matcher::GetCaptureIndex(int letter) {
    int i = letter - '1';
    if (i < 0 || i >= m_Level || m_Captures[i].m_Length == kUnfinished) {
        m_State.Error("invalid capture index");
    }
    return i;
}

const char* Matcher::MatchCapture(const char* s, int letter) {
    const Capture& capture = m_Captures[GetCaptureIndex(letter)];
    auto length = static_cast<size_t>(capture.m_Length);
    if (static_cast<size_t>(m_End - s) < length) return nullptr;
    return memcmp(capture.m_Begin, s, length) == 0 ? s + length : nullptr;
}

bool Matcher::MatchFrontier(const char* s, const char* p, const char* setEnd) {
    int previous = s == m_Begin ? 0 : AsByte(s[-1]);
    int present = s == m_End ? 0 : AsByte(*s);
    return !MatchSet(previous, p, setEnd) && MatchSet(present, p, setEnd);
}

// Items that have to match here and now, one after the other; what has a choice recurses.
const char* Matcher::Match(const char* s, const char* p) {
    if (++m_Depth > kMaxDepth) m_State.Error("pattern too complex");
    const char* end = MatchItem(s, p);
    m_Depth--;
    return end;
}

const char* Matcher::MatchItem(const char* s, const char*& p) {
    for (;;) {
        switch (*p) {
            case 0:
                return s;
            case '(':
                if (p[1] == ')') return OpenCapture(s, p + 2, kPosition);
                return OpenCapture(s, p + 1, kUnfinished);
            case ')':
                return CloseCapture(s, p + 1);
            case '$':
                if (p[1] == 0) return s == m_End ? s : nullptr;
                break;
            case kEscape:
                if (p[1] == 'b') {
                    s = MatchBalance(s, p + 2);
                    if (!s) return nullptr;
                    p += 4;
                    continue;
                }
                if (p[1] == 'f') {
                    p += 2;
                    if (*p != '[') m_State.Error("missing '[' after '%%f' in pattern");
                    const char* itemEnd = FindItemEnd(p);
                    if (!MatchFrontier(s, p, itemEnd - 1)) return nullptr;
                    p = itemEnd;
                    continue;
                }
                if (IsDigit(AsByte(p[1]))) {
                    s = MatchCapture(s, AsByte(p[1]));
                    if (!s) return nullptr;
                    p += 2;
                    continue;
                }
                break;
            default:
                break;
        }
        const char* itemEnd = FindItemEnd(p);
        bool matches = s < m_End && MatchSingle(AsByte(*s), p, itemEnd);
        switch (*itemEnd) {
            case '?':
                if (matches) {
                    if (const char* end = Match(s + 1, itemEnd + 1)) return end;
                }
                p = itemEnd + 1;
                continue;
            case '*':
                return ExpandMost(s, p, itemEnd);
            case '+':
                return matches ? ExpandMost(s + 1, p, itemEnd) : nullptr;
            case '-':
                return ExpandLeast(s, p, itemEnd);
            default:
                if (!matches) return nullptr;
                s++;
                p = itemEnd;
        }
    }
}

void Matcher::PushCapture(int i, const char* begin, const char* end) {
    if (i >= m_Level) {
        if (i != 0) m_State.Error("invalid capture index");
        m_State.PushString({begin, static_cast<size_t>(end - begin)});
        return;
    }
    const Capture& capture = m_Captures[i];
    if (capture.m_Length == kUnfinished) m_State.Error("unfinished capture");
    if (capture.m_Length == kPosition) {
        m_State.PushNumber(static_cast<double>(capture.m_Begin - m_Begin + 1));
    } else {
        m_State.PushString({capture.m_Begin, static_cast<size_t>(capture.m_Length)});
    }
}

int Matcher::PushCaptures(const char* begin, const char* end) {
    int count = m_Level == 0 && begin ? 1 : m_Level;
    m_State.NeedNativeStack(count, "too many captures");
    for (int i = 0; i < count; i++) PushCapture(i, begin, end);
    return count;
}

}  // namespace Korvel::TextForm

// Matching of patterns in strings.
#pragma once

#include "textform/State.h"

namespace Korvel::TextForm {

// One search: a text, a pattern and what the pattern has captured. A zero byte ends the pattern.
class Matcher {
public:
    static constexpr int kMaxCaptures = 32;

    Matcher(State& L, std::string_view text, const char* pattern)
        : m_State(L), m_Begin(text.data()), m_End(text.data() + text.size()), m_Pattern(pattern) {}

    // Where a match that begins at `place` ends; null without one. Raises errors of the pattern.
    const char* Match(const char* place) {
        m_Level = 0;
        m_Depth = 0;
        return Match(place, m_Pattern);
    }

    const char* GetBegin() const { return m_Begin; }
    const char* GetEnd() const { return m_End; }
    // Pushes a capture; the whole match stands in for the first one when there is none.
    void PushCapture(int i, const char* begin, const char* end);
    // Pushes all; with `begin` null, none stands in. Returns how many.
    int PushCaptures(const char* begin, const char* end);

private:
    static constexpr ptrdiff_t kUnfinished = -1;
    static constexpr ptrdiff_t kPosition = -2;
    static constexpr int kMaxDepth = 4000;

    struct Capture {
        const char* m_Begin;
        ptrdiff_t m_Length;
    };

    const char* Match(const char* s, const char* p);
    const char* MatchItem(const char* s, const char*& p);
    const char* FindItemEnd(const char* p);
    bool MatchSingle(int c, const char* p, const char* itemEnd);
    static bool MatchClass(int c, int letter);
    static bool MatchSet(int c, const char* p, const char* setEnd);
    const char* MatchBalance(const char* s, const char* p);
    const char* ExpandMost(const char* s, const char* p, const char* itemEnd);
    const char* ExpandLeast(const char* s, const char* p, const char* itemEnd);
    const char* OpenCapture(const char* s, const char* p, ptrdiff_t kind);
    const char* CloseCapture(const char* s, const char* p);
    const char* MatchCapture(const char* s, int letter);
    bool MatchFrontier(const char* s, const char* p, const char* setEnd);
    int GetCaptureIndex(int letter);

    State& m_State;
    const char* m_Begin;
    const char* m_End;
    const char* m_Pattern;
    int m_Level = 0;  // captures opened so far
    int m_Depth = 0;
    Capture m_Captures[kMaxCaptures];
};

}  // namespace Korvel::TextForm

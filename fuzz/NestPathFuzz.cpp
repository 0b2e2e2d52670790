// Nest paths over tables of any shape, against a walk that takes the path apart naively: the Const
// forms find what it finds and change nothing, the others make at most what they return.
#include <strings.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "core/ScriptVal.h"

using namespace Korvel;

namespace {

void Check(bool holds) {
    if (!holds) abort();
}

struct Input {
    uint8_t Next() { return m_Size ? (m_Size--, *m_Data++) : 0; }

    const uint8_t* m_Data;
    size_t m_Size;
};

ScriptVal MakeKey(uint8_t code) {
    static const char* const texts[] = {"a", "A", "b", "ab", "", " ", "1", "-1", "1a", "\xC3\xA4"};
    if (code % 16 < 10) return texts[code % 16];
    if (code % 16 < 14) return code / 16 - 2;
    return code % 16 == 14 ? ScriptVal(code / 32.0) : ScriptVal(true);
}

// A root made from the head of the input; the rest is a path. A copy would lose what is read-only.
ScriptVal MakeRoot(Input& in) {
    ScriptVal root(in.Next() % 16 ? SV_Table : SV_Args, nullptr);
    std::vector<ScriptVal*> open = {&root}, fixed;
    for (int i = in.Next() % 64; i > 0; i--) {
        const uint8_t code = in.Next();
        if (code % 8 == 0) {
            if (open.size() > 1) open.pop_back();
            continue;
        }
        ScriptVal& value = open.back()->FindKey(MakeKey(in.Next()));
        if (code % 8 < 4) {
            value.Ensure(SV_Table);
            open.push_back(&value);
        } else if (code % 8 < 6 && !value.IsTable()) {
            value = code;
        }
        if (code / 8 % 8 == 0) fixed.push_back(&value);
    }
    for (ScriptVal* value : fixed) value->m_Flags |= SVF_ReadOnly;
    return root;
}

bool IsSame(const ScriptVal& a, const ScriptVal& b) {
    if (a.m_Flags != b.m_Flags) return false;
    if (!a.IsTable() && !a.IsArgs()) return a == b;
    const TableEntry* x = a.m_Value.m_Table.m_Table;
    const TableEntry* y = b.m_Value.m_Table.m_Table;
    for (; x && y; x = x->m_Next, y = y->m_Next) {
        if (!IsSame(x->m_Key, y->m_Key) || !IsSame(x->m_Value, y->m_Value)) return false;
    }
    return !x && !y;
}

// The place of one key in one table; null when it is absent.
const ScriptVal* Step(const ScriptVal& table, std::string segment, bool noCase) {
    if (segment[0] == '\xFF') segment[0] = '?';  // no text begins with the marker of a cell
    char* end = nullptr;
    const long number = strtol(segment.c_str(), &end, 10);
    const bool isNumber = *end == 0;
    for (const TableEntry* e = table.m_Value.m_Table.m_Table; e; e = e->m_Next) {
        const char* text = e->m_Key.ToString();
        if (isNumber ? e->m_Key == static_cast<double>(number)
                     : text && !(noCase ? strcasecmp : strcmp)(text, segment.c_str())) {
            return &e->m_Value;
        }
    }
    return nullptr;
}

// The table that has to hold the last key, and the place of that key in it.
struct Walk {
    Walk(const ScriptVal& root, std::string path, bool noCase) : m_Table(&root) {
        for (size_t dot; (dot = path.find('.')) != std::string::npos; path.erase(0, dot + 1)) {
            if (m_Table)
                m_Table =
                    m_Table->IsTable() ? Step(*m_Table, path.substr(0, dot), noCase) : nullptr;
        }
        if (m_Table && !m_Table->IsTable()) m_Table = nullptr;
        if (m_Table) m_Found = Step(*m_Table, path, noCase);
    }

    const ScriptVal* m_Table;
    const ScriptVal* m_Found = nullptr;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    for (unsigned form = 0; form < 6; form++) {
        const bool noCase = form % 2 != 0, create = form >= 4;
        Input in{data, size}, again{data, size};
        ScriptVal root = MakeRoot(in);
        const ScriptVal before = MakeRoot(again);
        // As a value, for no plain text may begin with the marker of a cell.
        const ScriptVal path(reinterpret_cast<const char*>(in.m_Data), static_cast<int>(in.m_Size));
        const Walk walk(root, path.ToString(), noCase);
        if (form < 2) {
            const ScriptVal* found =
                noCase ? root.FindKeyNoCaseNestConst(path) : root.FindKeyNestConst(path);
            const ScriptVal* none = walk.m_Table && !noCase ? &ScriptVal::nil : nullptr;
            Check(found == (walk.m_Found ? walk.m_Found : none) && IsSame(root, before));
            continue;
        }
        ScriptVal* reached =
            noCase ? root.FindKeyNoCaseNest(path, create) : root.FindKeyNest(path, create);
        const Walk after(root, path.ToString(), noCase);
        // In a read-only table no key is made: the place is one that forgets.
        const bool isFixed = after.m_Table && (after.m_Table->m_Flags & SVF_ReadOnly);
        Check(after.m_Found ? reached == after.m_Found : isFixed ? reached->IsNil() : !reached);
        if (walk.m_Found || !reached) {
            Check(reached == walk.m_Found && IsSame(root, before));
        } else if (!create) {
            Check(walk.m_Table && walk.m_Table == after.m_Table);
        }
        if (!after.m_Found) continue;
        *reached = "written";
        Check(*after.m_Found == "written" || (reached->m_Flags & SVF_ReadOnly));
    }
    return 0;
}

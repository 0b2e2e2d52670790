// What looks at or changes values at all levels: equality, merging, translation, printing.
#include <cstdio>

#include "Platform/NoKillInternal.h"
#include "core/NumbersInternal.h"
#include "core/ScriptHooksInternal.h"
#include "core/ScriptValInternal.h"

namespace Korvel {
namespace {

enum class Answer { No, Yes, BothTables };

// Equality up to the contents of tables.
Answer CompareShallow(const ScriptVal& a, const ScriptVal& b) {
    if (a.Type() != b.Type()) return Answer::No;
    auto answer = [](bool isEqual) { return isEqual ? Answer::Yes : Answer::No; };
    switch (a.Type()) {
        case SV_Nil:
            return Answer::Yes;
        case SV_Number:
            return answer(a.m_Value.m_Number == b.m_Value.m_Number);
        case SV_String:
            return answer(a.m_Value.m_String.m_Hash == b.m_Value.m_String.m_Hash &&
                          strcmp(a.m_Value.m_String.m_String, b.m_Value.m_String.m_String) == 0);
        case SV_Boolean:
            return answer(a.m_Value.m_Boolean == b.m_Value.m_Boolean);
        case SV_Table:
            return Answer::BothTables;
        case SV_RemoteObject:
            return answer(
                g_ScriptHooks.m_IsSameRemote(a.m_Value.m_RemoteObject, b.m_Value.m_RemoteObject));
        case SV_LocalObject:
            return answer(a.ToLocalObject() == b.ToLocalObject());
        case SV_MemBlock: {
            MemBlock left = a.ToMemBlock();
            MemBlock right = b.ToMemBlock();
            return answer(left.m_Size == right.m_Size &&
                          (left.m_Size == 0 || memcmp(left.m_Ptr, right.m_Ptr, left.m_Size) == 0));
        }
        default:
            return Answer::No;
    }
}

// The comparison of two tables, at one entry of the left one.
struct TablePair {
    TablePair() = default;
    TablePair(const ScriptVal& left, const ScriptVal& right)
        : m_Left(Chain::FirstThatCounts(Chain::Head(left))),
          m_RightHead(Chain::Head(right)),
          m_RightStart(m_RightHead),
          m_Right(m_RightHead) {}

    bool HasSameCount() const {
        TableEntry* left = m_Left;
        TableEntry* right = Chain::FirstThatCounts(m_RightHead);
        while (left && right) {
            left = Chain::FirstThatCounts(left->m_Next);
            right = Chain::FirstThatCounts(right->m_Next);
        }
        return !left && !right;
    }

    // On to the next entry of the left table. Equal tables mostly have their keys in the same
    // order, so the search on the right begins behind the entry found last; as keys are unique, it
    // may begin anywhere.
    void StepLeft() {
        m_Left = Chain::FirstThatCounts(m_Left->m_Next);
        m_RightStart = m_Right = AfterRight();
        m_IsAtValue = false;
    }
    // On to the next entry of the right table, around its end; false when all have been seen.
    bool StepRight() {
        m_Right = AfterRight();
        return m_Right != m_RightStart;
    }

    TableEntry* m_Left;  // null when all are found
    TableEntry* m_RightHead;
    TableEntry* m_RightStart;
    TableEntry* m_Right;
    bool m_IsAtValue = false;  // the keys are equal, the values are compared

private:
    TableEntry* AfterRight() const { return m_Right->m_Next ? m_Right->m_Next : m_RightHead; }
};

bool AreTablesEqual(const ScriptVal& a, const ScriptVal& b) {
    WorkStack<TablePair> outer;
    TablePair pair(a, b);
    if (!pair.HasSameCount()) return false;
    for (;;) {
        Answer answer = Answer::Yes;
        if (pair.m_Left) {
            const ScriptVal& left = pair.m_IsAtValue ? pair.m_Left->m_Value : pair.m_Left->m_Key;
            const ScriptVal& right = pair.m_IsAtValue ? pair.m_Right->m_Value : pair.m_Right->m_Key;
            answer = CompareShallow(left, right);
            if (pair.m_IsAtValue && right.IsNil()) answer = Answer::No;
            if (answer == Answer::BothTables) {
                TablePair inner(left, right);
                answer = Answer::No;
                if (inner.HasSameCount()) {
                    if (!outer.Push(pair)) return false;
                    pair = inner;
                    continue;
                }
            }
        }
        // The answer is that of a pair of keys or values, or, when none are left, of the tables:
        // then it belongs to the pair around them.
        for (;;) {
            if (!pair.m_Left) {
                if (outer.IsEmpty()) return answer == Answer::Yes;
                pair = outer.Pop();
            }
            if (answer == Answer::Yes) {
                if (pair.m_IsAtValue) {
                    pair.StepLeft();
                } else {
                    pair.m_IsAtValue = true;
                }
                break;
            }
            if (!pair.m_IsAtValue && pair.StepRight()) break;
            pair.m_Left = nullptr;
        }
    }
}

// What an operation takes out of a value goes when the operation has ended: host code that runs for
// it may come back to the value.
class LeftOver {
public:
    LeftOver() = default;
    LeftOver(const LeftOver&) = delete;
    LeftOver& operator=(const LeftOver&) = delete;
    ~LeftOver() { ReleaseChain(m_Entries); }

    void Add(TableEntry* entry) { entry->m_Next = std::exchange(m_Entries, entry); }

    // Makes a value nil; false, with nothing done, when it is read-only or there is no memory.
    [[nodiscard]] bool TakeOut(ScriptVal& value) {
        if (value.IsReadOnly()) return false;
        if (value.HasPayload()) {
            TableEntry* entry = NewEntry();
            if (!entry) return false;
            entry->m_Value = std::move(value);
            Add(entry);
        }
        value = SV_Nil;
        return true;
    }

private:
    TableEntry* m_Entries = nullptr;
};

// Merging consumes its source, which is a copy, so that it needs no memory.
class Merger {
public:
    void Merge(ScriptVal& to, TableEntry* chain) {
        while (chain) {
            TableEntry* entry = std::exchange(chain, chain->m_Next);
            entry->m_Next = nullptr;
            if (TableEntry* found = Chain::Find(to, entry->m_Key)) {
                MergeValue(found->m_Value, entry);
            } else {
                Chain::Insert(to, entry);
            }
        }
    }

    // Takes the tables within tables that wait to be merged.
    void MergeWaiting() {
        while (TableEntry* entry = m_Waiting) {
            m_Waiting = entry->m_Next;
            if (!m_Waiting) m_WaitingEnd = &m_Waiting;
            ScriptVal::TablePayload& payload = entry->m_Value.m_Value.m_Table;
            auto* to = reinterpret_cast<ScriptVal*>(std::exchange(payload.m_Last, nullptr));
            Merge(*to, std::exchange(payload.m_Table, nullptr));
            m_LeftOver.Add(entry);
        }
    }

private:
    void MergeValue(ScriptVal& to, TableEntry* entry) {
        ScriptVal& from = entry->m_Value;
        bool isWritable = !to.IsReadOnly();
        if (isWritable && to.IsTable() && from.IsTable()) {
            from.m_Value.m_Table.m_Last = reinterpret_cast<TableEntry*>(&to);
            *m_WaitingEnd = entry;
            m_WaitingEnd = &entry->m_Next;
            return;
        }
        if (isWritable && (to.IsNil() || to.Type() == from.Type())) {
            std::swap(to.m_Flags, from.m_Flags);
            std::swap(to.m_Value, from.m_Value);
        }
        m_LeftOver.Add(entry);
    }

    LeftOver m_LeftOver;
    TableEntry* m_Waiting = nullptr;  // each holds in its table's m_Last the table to merge into
    TableEntry** m_WaitingEnd = &m_Waiting;
};

// A table from which entries are taken, at one of them.
struct Subtraction {
    Subtraction() = default;
    Subtraction(ScriptVal& table, const ScriptVal& other)
        : m_Table(&table), m_Other(&other), m_Entry(Chain::Head(table)) {}

    ScriptVal* m_Table;
    const ScriptVal* m_Other;
    TableEntry* m_Entry;
    bool m_IsGone = true;  // all entries so far
};

// Takes away what `other` has equally. Without memory it ends where it is.
void SubtractTables(ScriptVal& table, const ScriptVal& other) {
    LeftOver leftOver;
    WorkStack<Subtraction> outer;
    Subtraction now(table, other);
    for (;;) {
        TableEntry* entry = now.m_Entry;
        if (!entry) {
            if (now.m_IsGone && !leftOver.TakeOut(*now.m_Table)) return;
            if (outer.IsEmpty()) return;
            now = outer.Pop();
            entry = now.m_Entry;
        } else if (TableEntry* found = Chain::Find(*now.m_Other, entry->m_Key)) {
            ScriptVal& value = entry->m_Value;
            bool isWritable = !value.IsReadOnly();
            if (isWritable && value.IsTable() && found->m_Value.IsTable()) {
                if (!outer.Push(now)) return;
                now = Subtraction(value, found->m_Value);
                continue;
            }
            bool isTakenOut = isWritable && !value.IsTable() && value == found->m_Value;
            if (isTakenOut && !leftOver.TakeOut(value)) return;
        } else {
            now.m_IsGone = false;
        }
        if (!entry->m_Value.IsNil()) now.m_IsGone = false;
        now.m_Entry = entry->m_Next;
    }
}

bool IsTranslation(const ScriptVal& value) {
    const char* constructor = value.GetConstructor();
    return constructor && strcmp(constructor, "__tr") == 0;
}

// False when there is no memory.
bool TranslateOne(ScriptVal& value, const char* domain, LeftOver& leftOver) {
    auto field = [&value](int key) { return ScriptVal(value.FindKey(key, SVF_Int, SVF_Int)); };
    ScriptVal text = field(1);
    ScriptVal comment = field(2);
    ScriptVal number = field(3);
    ScriptVal ownDomain = field(4);
    ScriptVal result;
    if (g_Translate) {
        result = static_cast<const char*>(g_Translate(ownDomain.ToString(domain), text.ToString(),
                                                      comment.ToString(),
                                                      ToInt64(number.ToNumber(-1.0))));
        if (!result.IsString()) return false;
    } else {
        result = std::move(text);
    }
    if (value.IsReadOnly()) return true;
    if (!leftOver.TakeOut(value)) return false;
    value = std::move(result);
    return true;
}

void Blanks(int indent) {
    for (int i = 0; i < indent; i++) fputs("  ", stdout);
}

void PrintHalves(const char* label, uint64_t value) {
    printf("%s: %08x%08x", label, static_cast<uint32_t>(value >> 32), static_cast<uint32_t>(value));
}

void PrintFlat(const ScriptVal& value) {
    switch (value.Type()) {
        case SV_Nil:
            fputs("nil", stdout);
            break;
        case SV_Number:
            if (value.m_Flags & SVF_Integer) {
                printf("%lld", value.ToInteger());
            } else if (value.m_Flags & SVF_Narrow) {
                printf("%g", value.ToNumber());
            } else {
                printf("%.15g", value.ToNumber());
            }
            break;
        case SV_String:
            printf("\"%s\"", value.ToString());
            break;
        case SV_Boolean:
            fputs(value.ToBoolean() ? "true" : "false", stdout);
            break;
        case SV_Function:
            PrintHalves("Function", value.ToFunction());
            break;
        case SV_RemoteObject:
            printf("Object: %p", static_cast<void*>(value.ToRemoteObject()));
            break;
        case SV_Code:
            fputs("[Code]", stdout);
            break;
        case SV_MemBlock:
            printf("MemBlock (%u bytes)", value.ToMemBlock().m_Size);
            break;
        case SV_Pointer:
            PrintHalves("Pointer", value.m_Value.m_Pointer);
            break;
        default:
            fputs("???", stdout);
            break;
    }
}

}  // namespace

bool ScriptVal::operator==(const ScriptVal& other) const {
    Answer answer = CompareShallow(*this, other);
    return answer == Answer::BothTables ? AreTablesEqual(*this, other) : answer == Answer::Yes;
}

bool ScriptVal::operator==(const char* text) const {
    return IsString() && text && strcmp(ToString(), TextCell::Text(text)) == 0;
}

ScriptVal& ScriptVal::operator+=(const ScriptVal& other) {
    if (IsReadOnly()) return *this;
    if (IsTable() && other.IsTable()) {
        ScriptVal copy(other);
        TableEntry* chain = copy.TakeTable();
        Merger merger;
        merger.Merge(*this, chain);
        merger.MergeWaiting();
    } else if (IsNil() || Type() == other.Type()) {
        *this = other;
    }
    return *this;
}

ScriptVal& ScriptVal::operator-=(const ScriptVal& other) {
    if (IsReadOnly()) return *this;
    if (!IsTable()) {
        if (*this == other) *this = SV_Nil;
    } else if (other.IsTable()) {
        // A copy, because `other` may be among what is taken away.
        ScriptVal copy(other);
        if (copy.IsTable()) SubtractTables(*this, copy);
    }
    return *this;
}

int ScriptVal::Translate(const char* domain) {
    LeftOver leftOver;
    ScriptVal held(domain);  // which may be a part of what is replaced
    domain = held.ToString();
    if (IsTranslation(*this)) return TranslateOne(*this, domain, leftOver) ? 1 : 0;
    if (!Chain::IsList(*this)) return 0;
    int count = 0;
    WorkStack<TableEntry*> rest;
    TableEntry* entry = Chain::Head(*this);
    for (;;) {
        if (!entry) {
            if (rest.IsEmpty()) return count;
            entry = rest.Pop();
            continue;
        }
        ScriptVal& value = entry->m_Value;
        entry = entry->m_Next;
        if (IsTranslation(value)) {
            if (TranslateOne(value, domain, leftOver)) count++;
        } else if (Chain::IsList(value) && (!entry || rest.Push(entry))) {
            entry = Chain::Head(value);
        }
    }
}

void ScriptVal::Dump(int indent, bool newline) const {
    Platform::NoKill noKill;
    WorkStack<TableEntry*> rest;
    TableEntry* entry = nullptr;  // the next one to print
    int level = indent;
    auto open = [&](const ScriptVal& list) {
        fputs("Table\n", stdout);
        Blanks(level);
        fputs("{\n", stdout);
        entry = Chain::Head(list);
        level++;
    };
    if (Chain::IsList(*this)) {
        open(*this);
    } else {
        PrintFlat(*this);
    }
    while (level > indent) {
        if (!entry) {
            level--;
            Blanks(level);
            fputs("}", stdout);
            if (level > indent) {
                fputs("\n", stdout);
                entry = rest.Pop();
            }
            continue;
        }
        TableEntry* current = entry;
        entry = entry->m_Next;
        Blanks(level);
        if (current->m_Key.IsTable()) {
            fputs("[Table]", stdout);
        } else {
            PrintFlat(current->m_Key);
        }
        fputs(" = ", stdout);
        if (Chain::IsList(current->m_Value) && rest.Push(entry)) {
            open(current->m_Value);
        } else {
            PrintFlat(current->m_Value);
            fputs("\n", stdout);
        }
    }
    if (newline) fputs("\n", stdout);
}

}  // namespace Korvel

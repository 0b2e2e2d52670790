// Tables and args lists: their chains, look-ups by key and by path, and what is done entry by
// entry.
#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <iterator>

#include "core/ScriptValInternal.h"
#include "core/TextProbeInternal.h"
#include "objects/ScriptSymbol.h"

namespace Korvel {

namespace Chain {

// Where a number key is, or the link at which it belongs.
struct Place {
    TableEntry* m_Found;
    TableEntry** m_Link;
};

// A search from the head.
static Place SearchNumber(ScriptVal& list, double key) {
    TableEntry** link = &list.m_Value.m_Table.m_Table;
    for (; TableEntry* entry = *link; link = &entry->m_Next) {
        double number = NumberOf(entry);
        if (number == key) return {entry, nullptr};
        if (number > key) break;
    }
    return {nullptr, link};
}

// Rows of ascending keys are built, and read back, at the end.
static inline Place PlaceOfNumber(ScriptVal& list, double key) {
    if (list.IsTable() && Head(list)) {
        TableEntry* last = list.m_Value.m_Table.m_Last;
        double lastKey = NumberOf(last);
        if (key > lastKey) return {nullptr, &last->m_Next};
        if (key == lastKey) return {last, nullptr};
    }
    return SearchNumber(list, key);
}

TableEntry* FindNumber(const ScriptVal& list, double key) {
    return PlaceOfNumber(const_cast<ScriptVal&>(list), key).m_Found;
}

// The first entry from `entry` on with a text key for which the test holds.
template <class Test>
static TableEntry* FindString(TableEntry* entry, Test test) {
    for (; entry; entry = entry->m_Next) {
        if (entry->m_Key.IsString() && test(entry->m_Key.m_Value.m_String)) return entry;
    }
    return nullptr;
}

// Short lists are searched by probes, which cost less than the hash of the key. The hash is worth
// it as soon as another text has the same probe.
TableEntry* FindText(const ScriptVal& list, const KeyText& key) {
    uint32_t probe = GetTextProbe(key.Get(), key.GetLength());
    TableEntry* found = FindString(Head(list), [=](auto& other) { return other.m_Probe == probe; });
    if (!found || key.Equals(found->m_Key.ToString())) return found;
    uint32_t hash = GetHashValue(key.Get(), static_cast<int>(key.GetLength()));
    return FindString(found->m_Next, [&](auto& other) {
        return other.m_Hash == hash && key.Equals(other.m_String + 1);
    });
}

// The hash does not know case.
TableEntry* FindTextNoCase(const ScriptVal& list, const KeyText& key) {
    uint32_t hash = GetHashValue(key.Get(), static_cast<int>(key.GetLength()));
    return FindString(Head(list), [&](const auto& other) {
        return other.m_Hash == hash && key.EqualsNoCase(other.m_String + 1);
    });
}

static TableEntry* FindSameText(const ScriptVal& list, const ScriptVal& key) {
    const auto& wanted = key.m_Value.m_String;
    return FindString(Head(list), [&](const auto& other) {
        return other.m_Hash == wanted.m_Hash &&
               (other.m_String == wanted.m_String || strcmp(other.m_String, wanted.m_String) == 0);
    });
}

TableEntry* Find(const ScriptVal& list, const ScriptVal& key) {
    if (key.IsString()) return FindSameText(list, key);
    if (key.IsNumber()) return FindNumber(list, key.m_Value.m_Number);
    for (TableEntry* entry = Head(list); entry; entry = entry->m_Next) {
        if (entry->m_Key == key) return entry;
    }
    return nullptr;
}

// Links an entry in. Only a table keeps its last entry.
static void InsertAt(ScriptVal& list, TableEntry** link, TableEntry* entry) {
    entry->m_Next = *link;
    *link = entry;
    if (list.IsTable() && !entry->m_Next) list.m_Value.m_Table.m_Last = entry;
}

TableEntry* Obtain(ScriptVal& list, double key, uint32_t set, uint32_t clear) {
    bool isWritable = !list.IsReadOnly();
    Place place = PlaceOfNumber(list, key);
    TableEntry* entry = place.m_Found;
    if (!entry) {
        entry = isWritable ? NewEntry(key) : nullptr;
        if (!entry) return nullptr;
        InsertAt(list, place.m_Link, entry);
    }
    if ((set | clear) && isWritable) {
        entry->m_Key.m_Flags &= ~clear | SVF_TypeMask;
        entry->m_Key.m_Flags |= set & ~SVF_TypeMask;
    }
    return entry;
}

void Append(ScriptVal& list, TableEntry* entry) {
    TableEntry** link = &list.m_Value.m_Table.m_Table;
    if (list.IsTable() && *link) link = &list.m_Value.m_Table.m_Last->m_Next;
    while (*link) link = &(*link)->m_Next;
    InsertAt(list, link, entry);
}

void Insert(ScriptVal& list, TableEntry* entry) {
    if (entry->m_Key.IsNumber()) {
        InsertAt(list, PlaceOfNumber(list, NumberOf(entry)).m_Link, entry);
    } else {
        Append(list, entry);
    }
}

}  // namespace Chain

namespace {

const char* const ErrorTable[] = {
    nullptr,          "Unknown Error",        "Invalid arguments.",    "Unsupported operation.",
    "Not logged in.", "Unknown Packet type.", "Invalid object.",       "Scripting not initialized.",
    "Invalid index.", "Unknown Symbol.",      "Invalid RemoteObject.",
};

// A new entry at the end, or where its number belongs; `invalid` for a read-only list and without
// memory.
ScriptVal& AddEntry(ScriptVal& list, ScriptVal key) {
    TableEntry* entry = !list.IsReadOnly() ? NewEntry(std::move(key)) : nullptr;
    if (!entry) return InvalidValue();
    Chain::Insert(list, entry);
    return entry->m_Value;
}

ScriptVal& AddCopy(ScriptVal& list, const ScriptVal& key) {
    ScriptVal copy(key);
    return IsLostCopy(copy, key) ? InvalidValue() : AddEntry(list, std::move(copy));
}

// For a text key, which is nil when there is no memory for it.
ScriptVal& AddText(ScriptVal& list, ScriptVal key) {
    return key.IsString() ? AddEntry(list, std::move(key)) : InvalidValue();
}

// A text of a known length is taken as it is, but stored with a first byte that is no cell's.
bool BeginsLikeCell(const char* key, int length) {
    return length > 0 && TextCell::IsCell(key);
}

const ScriptVal& FoundOrNil(const TableEntry* found) {
    return found ? found->m_Value : ScriptVal::nil;
}

const ScriptVal* FoundOrNull(const TableEntry* found) {
    return found ? &found->m_Value : nullptr;
}

// Calls `act` on a value and on all that are under it in its keys and values, as asked.
template <class Act>
void VisitAll(ScriptVal& root, bool keys, bool values, Act act) {
    act(root);
    if (!Chain::IsList(root)) return;
    WorkStack<TableEntry*> rest;
    TableEntry* entry = Chain::Head(root);
    auto enter = [&](ScriptVal& value) {
        act(value);
        if (!Chain::IsList(value) || !Chain::Head(value)) return;
        // What cannot be kept for later is left out: memory has run out.
        if (entry && !rest.Push(entry)) return;
        entry = Chain::Head(value);
    };
    for (;;) {
        if (!entry) {
            if (rest.IsEmpty()) return;
            entry = rest.Pop();
            continue;
        }
        TableEntry* current = entry;
        entry = current->m_Next;
        if (keys) enter(current->m_Key);
        if (values) enter(current->m_Value);
    }
}

}  // namespace

ScriptVal& ScriptVal::FindKey(const ScriptVal& key) {
    if (!Chain::IsList(*this)) return InvalidValue();
    TableEntry* found = Chain::Find(*this, key);
    return found ? found->m_Value : AddCopy(*this, key);
}

ScriptVal& ScriptVal::FindKey(const char* key) {
    if (!Chain::IsList(*this)) return InvalidValue();
    TableEntry* found = Chain::FindText(*this, KeyText(key));
    return found ? found->m_Value : AddText(*this, key ? key : "");
}

ScriptVal& ScriptVal::FindKey(const char* key, int length) {
    if (!Chain::IsList(*this)) return InvalidValue();
    if (BeginsLikeCell(key, length)) {
        ScriptVal safe(key, length);
        return safe.IsString() ? FindKey(safe) : InvalidValue();
    }
    KeyText text(key, length);
    TableEntry* found = Chain::FindText(*this, text);
    return found ? found->m_Value : AddText(*this, text.ToValue());
}

ScriptVal& ScriptVal::FindKey(double key, uint32_t set, uint32_t clear) {
    // Rows of ascending keys are built so often that the next one goes without the calls below.
    bool isTable = (m_Flags & (SVF_TypeMask | SVF_ReadOnly)) == SV_Table;
    TableEntry* last = m_Value.m_Table.m_Last;
    if (isTable && Chain::Head(*this) && key > Chain::NumberOf(last)) [[likely]] {
        TableEntry* added = NewEntry(key);
        if (!added) return InvalidValue();
        added->m_Key.m_Flags |= set & ~SVF_TypeMask;
        last->m_Next = m_Value.m_Table.m_Last = added;
        return added->m_Value;
    }
    TableEntry* entry = Chain::IsList(*this) ? Chain::Obtain(*this, key, set, clear) : nullptr;
    return entry ? entry->m_Value : InvalidValue();
}

const ScriptVal& ScriptVal::FindKeyConst(const ScriptVal& key) const {
    return Chain::IsList(*this) ? FoundOrNil(Chain::Find(*this, key)) : InvalidValue();
}

const ScriptVal& ScriptVal::FindKeyConst(const char* key) const {
    return Chain::IsList(*this) ? FoundOrNil(Chain::FindText(*this, KeyText(key))) : InvalidValue();
}

const ScriptVal& ScriptVal::FindKeyConst(const char* key, int length) const {
    if (!Chain::IsList(*this)) return InvalidValue();
    if (BeginsLikeCell(key, length)) {
        ScriptVal safe(key, length);
        return safe.IsString() ? FindKeyConst(safe) : nil;
    }
    return FoundOrNil(Chain::FindText(*this, KeyText(key, length)));
}

const ScriptVal& ScriptVal::FindKeyConst(double key) const {
    return Chain::IsList(*this) ? FoundOrNil(Chain::FindNumber(*this, key)) : InvalidValue();
}

ScriptVal* ScriptVal::FindKeyNoCase(const char* key) {
    if (!Chain::IsList(*this)) return nullptr;
    TableEntry* found = Chain::FindTextNoCase(*this, KeyText(key));
    return found ? &found->m_Value : &AddText(*this, key ? key : "");
}

ScriptVal* ScriptVal::FindKeyNoCase(const char* key, int length) {
    if (!Chain::IsList(*this)) return nullptr;
    if (BeginsLikeCell(key, length)) {
        ScriptVal safe(key, length);
        return safe.IsString() ? FindKeyNoCase(safe.ToString()) : &InvalidValue();
    }
    KeyText text(key, length);
    TableEntry* found = Chain::FindTextNoCase(*this, text);
    return found ? &found->m_Value : &AddText(*this, text.ToValue());
}

ScriptVal* ScriptVal::FindKeyNoCase(const ScriptVal& key) {
    return const_cast<ScriptVal*>(FindKeyNoCaseConst(key));
}

const ScriptVal* ScriptVal::FindKeyNoCaseConst(const char* key) const {
    return Chain::IsList(*this) ? FoundOrNull(Chain::FindTextNoCase(*this, KeyText(key))) : nullptr;
}

const ScriptVal* ScriptVal::FindKeyNoCaseConst(const char* key, int length) const {
    if (!Chain::IsList(*this)) return nullptr;
    if (BeginsLikeCell(key, length)) {
        ScriptVal safe(key, length);
        return safe.IsString() ? FindKeyNoCaseConst(safe) : nullptr;
    }
    return FoundOrNull(Chain::FindTextNoCase(*this, KeyText(key, length)));
}

const ScriptVal* ScriptVal::FindKeyNoCaseConst(const ScriptVal& key) const {
    if (!Chain::IsList(*this)) return nullptr;
    return FoundOrNull(key.IsString() ? Chain::FindTextNoCase(*this, KeyText(key))
                                      : Chain::Find(*this, key));
}

const ScriptVal* ScriptVal::FindKeyNoCaseConst(double key) const {
    return Chain::IsList(*this) ? FoundOrNull(Chain::FindNumber(*this, key)) : nullptr;
}

bool ScriptVal::Exists(const ScriptVal& key) const {
    return Chain::IsList(*this) && Chain::Find(*this, key);
}

namespace {

// One key of a nest path.
struct Segment {
    const char* m_Text;
    int m_Length;
    bool m_IsNumber;
    double m_Number = 0;
    bool m_IsLast;

    explicit Segment(const char* text) : m_Text(text) {
        const char* end = strchr(text, '.');
        m_IsLast = !end;
        size_t length = end ? static_cast<size_t>(end - text) : strlen(text);
        m_Length = static_cast<int>(std::min<size_t>(length, INT32_MAX));
        char* stop = nullptr;
        long number = strtol(text, &stop, 10);
        m_IsNumber = stop == text + length;
        if (m_IsNumber) m_Number = static_cast<double>(number);
    }

    const char* Next() const { return m_Text + m_Length + 1; }

    ScriptVal* FindOrMake(ScriptVal& table, bool noCase) const {
        if (m_IsNumber) return &table.FindKey(m_Number);
        return noCase ? table.FindKeyNoCase(m_Text, m_Length) : &table.FindKey(m_Text, m_Length);
    }
    const ScriptVal* Find(const ScriptVal& table, bool noCase) const {
        if (!noCase) {
            return &(m_IsNumber ? table.FindKeyConst(m_Number)
                                : table.FindKeyConst(m_Text, m_Length));
        }
        return m_IsNumber ? table.FindKeyNoCaseConst(m_Number)
                          : table.FindKeyNoCaseConst(m_Text, m_Length);
    }
};

// The table that holds the last key of a path, and that key in `last`; null when the way ends.
const ScriptVal* WalkNest(const ScriptVal& root, Segment& last, bool noCase) {
    const ScriptVal* table = &root;
    while (table->IsTable() && !last.m_IsLast) {
        table = last.Find(*table, noCase);
        last = Segment(last.Next());
    }
    return table->IsTable() ? table : nullptr;
}

ScriptVal* FindNest(ScriptVal* root, const char* path, bool create, bool noCase) {
    if (!path || IsNull(root)) return nullptr;
    Segment last(TextCell::Text(path));
    if (!create) {
        auto* table = const_cast<ScriptVal*>(WalkNest(*root, last, noCase));
        return table ? last.FindOrMake(*table, noCase) : nullptr;
    }
    // What has to make room for a table may be the path itself. There is one at most: what comes
    // below it is new.
    ScriptVal replaced;
    ScriptVal* table = root;
    for (; table->IsTable() && !last.m_IsLast; last = Segment(last.Next())) {
        table = last.FindOrMake(*table, noCase);
        if (IsInvalid(*table)) return nullptr;
        if (!table->IsTable() && !table->IsReadOnly()) {
            if (table->HasPayload()) replaced = std::move(*table);
            *table = SV_Table;
        }
    }
    return table->IsTable() ? last.FindOrMake(*table, noCase) : nullptr;
}

const ScriptVal* FindNestConst(const ScriptVal* root, const char* path, bool noCase) {
    if (!path || IsNull(root)) return nullptr;
    Segment last(TextCell::Text(path));
    const ScriptVal* table = WalkNest(*root, last, noCase);
    return table ? last.Find(*table, noCase) : nullptr;
}

}  // namespace

ScriptVal* ScriptVal::FindKeyNest(const char* path, bool create) {
    return FindNest(this, path, create, false);
}
ScriptVal* ScriptVal::FindKeyNoCaseNest(const char* path, bool create) {
    return FindNest(this, path, create, true);
}
const ScriptVal* ScriptVal::FindKeyNestConst(const char* path) const {
    return FindNestConst(this, path, false);
}
const ScriptVal* ScriptVal::FindKeyNoCaseNestConst(const char* path) const {
    return FindNestConst(this, path, true);
}

ScriptVal& ScriptVal::AddKey(const ScriptVal& key) {
    return IsTable() && key.IsString() ? AddCopy(*this, key) : FindKey(key);
}

ScriptVal& ScriptVal::AddKey(ScriptVal&& key) {
    return IsTable() && key.IsString() ? AddEntry(*this, std::move(key)) : FindKey(key);
}

bool ScriptVal::IsEmpty() const {
    TableEntry* entry = nullptr;
    return !NextKey(entry);
}

unsigned int ScriptVal::NumKeys() const {
    unsigned int count = 0;
    TableEntry* entry = nullptr;
    while (NextKey(entry)) count++;
    return count;
}

bool ScriptVal::NextKey(TableEntry*& entry) const {
    if (!Chain::IsList(*this)) return entry = nullptr, false;
    entry = Chain::FirstThatCounts(entry ? entry->m_Next : Chain::Head(*this));
    return entry;
}

namespace {

ScriptVal ReadRemote(const ScriptVal& object, const ScriptVal& key) {
    ScriptArgs args;
    ScriptVal reply;
    bool isDone =
        !key.IsNil() && args.SetPosition(0, key) && SendCommand(object, SST_GetTable, args, reply);
    return isDone ? reply.FindKeyConst(-1) : ScriptVal();
}

void WriteRemote(const ScriptVal& object, const ScriptVal& key, const ScriptVal& value) {
    ScriptArgs args;
    ScriptVal reply;
    if (key.IsNil() || !args.SetPosition(0, key) || !args.SetPosition(1, value)) return;
    SendCommand(object, SST_SetTable, args, reply);
}

template <class Key>
ScriptVal GetKeyOf(ScriptVal& value, Key key) {
    if (value.IsRemoteObject()) return ReadRemote(value, key);
    return value.FindKey(key);
}

template <class Key>
void SetKeyOf(ScriptVal& value, Key key, const ScriptVal& content) {
    if (value.IsRemoteObject()) {
        WriteRemote(value, key, content);
    } else if (Chain::IsList(value) && !value.IsReadOnly()) {
        value.FindKey(key) = content;
    }
}

}  // namespace

ScriptVal ScriptVal::GetKey(const char* key) {
    return GetKeyOf(*this, key);
}
ScriptVal ScriptVal::GetKey(double key) {
    return GetKeyOf(*this, key);
}
void ScriptVal::SetKey(const char* key, const ScriptVal& value) {
    SetKeyOf(*this, key, value);
}
void ScriptVal::SetKey(double key, const ScriptVal& value) {
    SetKeyOf(*this, key, value);
}

namespace {

// Merges two chains of ascending number keys; among equal keys the first chain's come first.
TableEntry* MergeNumbers(TableEntry* a, TableEntry* b) {
    TableEntry* head = nullptr;
    TableEntry** link = &head;
    while (a && b) {
        TableEntry*& first = Chain::NumberOf(b) < Chain::NumberOf(a) ? b : a;
        *link = first;
        link = &first->m_Next;
        first = first->m_Next;
    }
    *link = a ? a : b;
    return head;
}

// Sorts a chain of number keys, none of them NaN, keeping the order of equal ones.
TableEntry* SortNumbers(TableEntry* chain) {
    TableEntry* sorted[64] = {};  // chain i has 2^i entries, or none; a higher one comes earlier
    while (chain) {
        TableEntry* one = std::exchange(chain, chain->m_Next);
        one->m_Next = nullptr;
        unsigned i = 0;
        for (; sorted[i]; i++) one = MergeNumbers(std::exchange(sorted[i], nullptr), one);
        sorted[i] = one;
    }
    TableEntry* all = nullptr;
    for (TableEntry* part : sorted) all = MergeNumbers(part, all);
    return all;
}

// Puts `strays`, number keys in ascending order, before the first greater number keys of a chain,
// where there is one for each.
void InsertStrays(TableEntry** link, TableEntry* strays) {
    while (strays) {
        if (Chain::NumberOf(*link) > Chain::NumberOf(strays)) {
            TableEntry* stray = std::exchange(strays, strays->m_Next);
            stray->m_Next = *link;
            *link = stray;
            link = &stray->m_Next;
        } else {
            link = &(*link)->m_Next;
        }
    }
}

}  // namespace

void ScriptVal::SetTable(TableEntry* chain) {
    if (!IsTable() || IsReadOnly()) return;
    // The order is the one that entries would have got one by one. Those that come below a number
    // before them are taken out and go before the first greater one.
    TableEntry* strays = nullptr;
    TableEntry** strayLink = &strays;
    TableEntry* last = nullptr;
    double greatest = -HUGE_VAL;
    for (TableEntry** link = &chain; TableEntry* entry = *link;) {
        double number = Chain::NumberOf(entry);
        if (number < greatest) {
            *link = entry->m_Next;
            entry->m_Next = nullptr;
            *strayLink = entry;
            strayLink = &entry->m_Next;
            continue;
        }
        if (number > greatest) greatest = number;
        last = entry;
        link = &entry->m_Next;
    }
    if (strays) InsertStrays(&chain, SortNumbers(strays));
    m_Value.m_Table.m_Table = chain;
    m_Value.m_Table.m_Last = last;
}

TableEntry* ScriptVal::TakeTable() {
    if (!IsTable() || IsReadOnly()) return nullptr;
    m_Value.m_Table.m_Last = nullptr;
    return std::exchange(m_Value.m_Table.m_Table, nullptr);
}

const char* ScriptVal::GetConstructor() const {
    return IsTable() ? TextCell::Text(m_Value.m_Table.m_Constructor) : nullptr;
}

// Takes over the cell of a text; a nil leaves the table without a constructor.
static void TakeConstructor(ScriptVal& table, ScriptVal name) {
    const char* old = table.m_Value.m_Table.m_Constructor;
    table.m_Value.m_Table.m_Constructor =
        name.IsString() ? name.m_Value.m_String.m_String : nullptr;
    name.m_Flags = SV_Nil;
    TextCell::Drop(old);
}

void ScriptVal::SetConstructor(const char* name) {
    if (IsTable() && !IsReadOnly()) TakeConstructor(*this, name);
}

void ScriptVal::SetConstructor(const OxID& name) {
    if (IsTable() && !IsReadOnly()) TakeConstructor(*this, name);
}

void ScriptVal::SetFlagsRecurse(uint32_t flags, ScriptValType type, bool keys, bool values) {
    flags &= ~SVF_TypeMask;
    VisitAll(*this, keys, values, [=](ScriptVal& value) {
        if (value.Is(type)) value.m_Flags |= flags;
    });
}

void ScriptVal::ClearFlagsRecurse(uint32_t flags, ScriptValType type, bool keys, bool values) {
    flags &= ~SVF_TypeMask;
    VisitAll(*this, keys, values, [=](ScriptVal& value) {
        if (value.Is(type)) value.m_Flags &= ~flags;
    });
}

void ScriptVal::SetError(ScriptError code, const char* text) {
    if (!Chain::IsList(*this) || IsReadOnly()) return;
    char unknown[48];
    if (!text) {
        if (code >= 0 && static_cast<size_t>(code) < std::size(ErrorTable)) {
            text = ErrorTable[code];
        } else {
            snprintf(unknown, sizeof unknown, "Unknown error number %d.", static_cast<int>(code));
            text = unknown;
        }
    }
    ScriptVal held(text);  // which may be what "Error" holds
    FindKey("Error") = static_cast<int>(code);
    if (text) FindKey("ErrorString") = held;
}

template <>
void ScriptVal::TableFromArray(const double* values, int count) {
    if (IsReadOnly()) return;
    ScriptVal table;
    table = SV_Table;
    table.m_Flags |= SVF_Compact;
    TableEntry* chain = nullptr;
    for (int i = count; i > 0; i--) {
        TableEntry* entry = NewEntry(i);
        if (!entry) {
            ReleaseChain(chain);
            CleanUp();
            return;
        }
        entry->m_Key.m_Flags |= SVF_Int;
        entry->m_Value = values[i - 1];
        entry->m_Next = chain;
        if (!chain) table.m_Value.m_Table.m_Last = entry;
        chain = entry;
    }
    table.m_Value.m_Table.m_Table = chain;
    *this = std::move(table);
}

}  // namespace Korvel

#include <string>

#include "textform/Interpreter.h"
#include "textform/Vm.h"

namespace Korvel::TextForm {

namespace {

int TableForeach(State& L) {
    Table* table = L.CheckTable(1);
    L.CheckType(2, Type::Function);
    L.PushNil();
    L.PushNil();
    while (Next(L, table, L.m_Top - 2)) {
        L.Push(L.Arg(2));
        L.Push(L.m_Top[-3]);
        L.Push(L.m_Top[-3]);
        L.Call(2, 1);
        if (!L.m_Top[-1].IsNil()) return 1;
        L.Pop();
    }
    return 0;
}

int TableForeachi(State& L) {
    Table* table = L.CheckTable(1);
    int count = GetLength(table);
    L.CheckType(2, Type::Function);
    for (int i = 1; i <= count; i++) {
        L.Push(L.Arg(2));
        L.PushNumber(i);
        L.Push(*table->Get(i));
        L.Call(2, 1);
        if (!L.m_Top[-1].IsNil()) return 1;
        L.Pop();
    }
    return 0;
}

int TableMaxn(State& L) {
    Table* table = L.CheckTable(1);
    double greatest = 0;
    L.PushNil();
    L.PushNil();
    while (Next(L, table, L.m_Top - 2)) {
        const Value& key = L.m_Top[-2];
        if (key.IsNumber() && key.m_Number > greatest) greatest = key.m_Number;
    }
    L.PushNumber(greatest);
    return 1;
}

int TableGetn(State& L) {
    L.PushNumber(GetLength(L.CheckTable(1)));
    return 1;
}

int TableSetn(State& L) {
    L.CheckTable(1);
    L.Error("'setn' is obsolete");
}

int TableInsert(State& L) {
    Table* table = L.CheckTable(1);
    int end = GetLength(table) + 1;
    int place;
    switch (L.GetArgCount()) {
        case 2:
            place = end;
            break;
        case 3:
            place = L.CheckInt(2);
            if (place > end) end = place;
            for (int i = end; i > place; i--) {
                const Value value = *table->Get(i - 1);
                L.SetRaw(table, i, value);
            }
            break;
        default:
            L.Error("wrong number of arguments to 'insert'");
    }
    L.SetRaw(table, place, L.m_Top[-1]);
    return 0;
}

int TableRemove(State& L) {
    Table* table = L.CheckTable(1);
    int end = GetLength(table);
    auto place = static_cast<int>(L.OptInteger(2, end));
    if (!(1 <= place && place <= end)) return 0;
    L.Push(*table->Get(place));
    for (; place < end; place++) {
        const Value value = *table->Get(place + 1);
        L.SetRaw(table, place, value);
    }
    L.SetRaw(table, end, g_Nil);
    return 1;
}

int TableConcat(State& L) {
    std::string_view separator = L.OptString(2, "");
    Table* table = L.CheckTable(1);
    auto i = static_cast<int>(L.OptInteger(3, 1));
    int last = L.IsNoneOrNil(4) ? GetLength(table) : L.CheckInt(4);
    std::string text;
    for (; i <= last; i++) {
        Value value = *table->Get(i);
        if (value.IsString()) {
            text.append(value.AsString()->GetView());
        } else if (value.IsNumber()) {
            L.Push(value);
            L.ToString(L.m_Top - 1);
            text.append(L.m_Top[-1].AsString()->GetView());
            L.Pop();
        } else {
            L.Error("invalid value (%s) at index %d in table for 'concat'",
                    GetTypeName(value.m_Type), i);
        }
        if (i == last) break;
        text.append(separator);
    }
    L.PushString(text);
    return 1;
}

// ---- Sorting: in place, with the middle of three for a pivot. A comparer that contradicts itself
// is found out when a scan runs over the end.

bool IsLess(State& L, const Value& a, const Value& b) {
    if (L.Arg(2).IsNil()) return LessThan(L, &a, &b);
    const Value first = a;
    const Value second = b;
    L.Push(L.Arg(2));
    L.Push(first);
    L.Push(second);
    L.Call(2, 1);
    bool less = !L.m_Top[-1].IsFalse();
    L.Pop();
    return less;
}

void Swap(State& L, Table* table, int i, int j) {
    // both stand on the top
    L.SetRaw(table, i, L.m_Top[-1]);
    L.SetRaw(table, j, L.m_Top[-2]);
    L.Pop(2);
}

void PushPair(State& L, Table* table, int i, int j) {
    L.Push(*table->Get(i));
    L.Push(*table->Get(j));
}

// Puts the items at i < j into order.
void Order(State& L, Table* table, int i, int j) {
    PushPair(L, table, i, j);
    if (IsLess(L, L.m_Top[-1], L.m_Top[-2])) {
        Swap(L, table, i, j);
    } else {
        L.Pop(2);
    }
}

// Splits the range by the item at upper - 1, which stands on the top; returns where it comes to.
int Partition(State& L, Table* table, int lower, int upper) {
    int i = lower;
    int j = upper - 1;
    for (;;) {
        while (L.Push(*table->Get(++i)), IsLess(L, L.m_Top[-1], L.m_Top[-2])) {
            if (i > upper) L.Error("invalid order function for sorting");
            L.Pop();
        }
        while (L.Push(*table->Get(--j)), IsLess(L, L.m_Top[-3], L.m_Top[-1])) {
            if (j < lower) L.Error("invalid order function for sorting");
            L.Pop();
        }
        if (j < i) break;
        Swap(L, table, i, j);
    }
    L.Pop(3);
    PushPair(L, table, upper - 1, i);
    Swap(L, table, upper - 1, i);
    return i;
}

void Sort(State& L, Table* table, int lower, int upper) {
    while (lower < upper) {
        Order(L, table, lower, upper);
        if (upper - lower == 1) return;
        int middle = static_cast<int>((static_cast<unsigned>(lower) + upper) / 2);
        PushPair(L, table, middle, lower);
        if (IsLess(L, L.m_Top[-2], L.m_Top[-1])) {
            Swap(L, table, middle, lower);
        } else {
            L.Pop();
            L.Push(*table->Get(upper));
            if (IsLess(L, L.m_Top[-1], L.m_Top[-2])) {
                Swap(L, table, middle, upper);
            } else {
                L.Pop(2);
            }
        }
        if (upper - lower == 2) return;
        L.Push(*table->Get(middle));
        L.Push(L.m_Top[-1]);
        L.Push(*table->Get(upper - 1));
        Swap(L, table, middle, upper - 1);
        int split = Partition(L, table, lower, upper);
        // the smaller part here, the larger one in the next turn
        int smallLower = lower;
        int smallUpper = split - 1;
        if (split - lower < upper - split) {
            lower = split + 1;
        } else {
            smallLower = split + 1;
            smallUpper = upper;
            upper = split - 1;
        }
        Sort(L, table, smallLower, smallUpper);
    }
}

int TableSort(State& L) {
    Table* table = L.CheckTable(1);
    int count = GetLength(table);
    L.NeedNativeStack(40, "");
    if (!L.IsNoneOrNil(2)) L.CheckType(2, Type::Function);
    L.SetTop(2);
    Sort(L, table, 1, count);
    return 0;
}

constexpr NativeEntry kFunctions[] = {
    {"concat", TableConcat}, {"foreach", TableForeach}, {"foreachi", TableForeachi},
    {"getn", TableGetn},     {"maxn", TableMaxn},       {"insert", TableInsert},
    {"remove", TableRemove}, {"setn", TableSetn},       {"sort", TableSort},
};

}  // namespace

void OpenTable(State& L) {
    OpenLibrary(L, "table", kFunctions);
    L.Pop();
}

}  // namespace Korvel::TextForm

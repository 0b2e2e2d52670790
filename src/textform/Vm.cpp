// The machine's loop.
//
// The place in the code is kept in a local and stored in the call before anything that may raise an
// error, call, or ask where the call is. What may move the stack is followed by a new look at the
// base.
#include "textform/Vm.h"

#include <cmath>

#if defined(__SSE2__)
#include <emmintrin.h>
#endif

namespace Korvel::TextForm {

namespace {

// The processor's conversion: INT_MIN for what does not fit.
inline int CutToInt(double number) {
#if defined(__SSE2__)
    return _mm_cvttsd_si32(_mm_set_sd(number));
#else
    return ToInt32(number);
#endif
}

inline const Value* GetFast(const Table* table, const Value* key) {
    if (key->IsString()) return table->Get(key->AsString());
    if (key->IsNumber()) {
        int index = CutToInt(key->m_Number);
        if (static_cast<unsigned>(index) - 1 < static_cast<unsigned>(table->m_ArraySize) &&
            index == key->m_Number) {
            return table->m_Array + index - 1;
        }
    }
    return table->Get(*key);
}

// Whether a missing key of the table reads as nil.
inline bool HasNo(State& L, const Table* table, Event event) {
    return !table->m_Metatable || !L.GetMachine().GetFastMeta(table->m_Metatable, event);
}

int DecodeSizeHint(int hint) {
    int exponent = hint >> 3;
    return exponent == 0 ? hint : ((hint & 7) + 8) << (exponent - 1);
}

void MakeTable(State& L, Instruction i, Value* place) {
    int b = GetB(i);
    constexpr int kMaxHint = 23 << 3;
    if ((b & ~kCompactBit) > kMaxHint || GetC(i) > kMaxHint) L.RunError("table overflow");
    Table* table = NewTable(L, DecodeSizeHint(b & ~kCompactBit), DecodeSizeHint(GetC(i)));
    if (b & kCompactBit) table->m_Flags |= Table::kCompact;
    *place = Value::Of(table);
}

// Takes a pseudo-instruction for each up-value.
const Instruction* MakeClosure(State& L, ScriptClosure* outer, Instruction i, const Instruction* pc,
                               Value* base) {
    Machine& machine = L.GetMachine();
    Prototype* p = outer->m_Prototype->m_Prototypes[GetBx(i)];
    ScriptClosure* c = NewScriptClosure(machine, p, outer->m_Environment);
    for (int j = 0; j < c->m_UpValueCount; j++, pc++) {
        c->GetUpValues()[j] = GetOp(*pc) == Op::GetUpVal ? outer->GetUpValues()[GetB(*pc)]
                                                         : FindUpValue(L, base + GetB(*pc));
    }
    base[GetA(i)] = Value::Of(static_cast<Closure*>(c));
    return pc;
}

// Returns the next instruction.
const Instruction* StoreList(State& L, Instruction i, const Instruction* pc, Value* ra) {
    int count = GetB(i);
    unsigned block = GetC(i);
    if (count == 0) {
        count = static_cast<int>(L.m_Top - ra) - 1;
        L.m_Top = L.m_Call->m_Top;
    }
    if (block == 0) block = *pc++;
    if (!ra->IsTable())
        L.RunError("attempt to store list items in a %s value", GetTypeName(ra->m_Type));
    Table* table = ra->AsTable();
    int64_t last = (static_cast<int64_t>(block) - 1) * kFieldsPerFlush + count;
    if (last > INT32_MAX) L.RunError("table overflow");
    auto index = static_cast<int>(last);
    // All at once; items far beyond the array come from no constructor, and take no memory for it.
    if (index > table->m_ArraySize && index - count <= table->m_ArraySize) {
        ResizeArray(L, table, index);
    }
    for (; count > 0; count--, index--) {
        *SetSlot(L, table, index) = ra[count];
        L.GetMachine().BarrierBack(table, ra[count]);
    }
    table->m_Flags |= Table::kListItems;
    return pc;
}

void PrepareFor(State& L, Value* ra) {
    static constexpr const char* kWhat[] = {"initial value", "limit", "step"};
    for (int i = 0; i < 3; i++) {
        double number;
        if (!L.ReadNumber(ra[i], number)) L.RunError("'for' %s must be a number", kWhat[i]);
        ra[i] = Value::Number(number);
    }
    ra[0].m_Number -= ra[2].m_Number;
}

// `for ... in t` with a table walks it.
void PrepareGenericFor(State& L, Value* ra) {
    if (!ra->IsTable()) return;
    ra[1] = ra[0];
    ra[0] = *L.m_Globals->Get(L.GetMachine().NewString("next"));
}

// The arguments behind the fixed ones; returns the base.
Value* PushVarargs(State& L, const Prototype* p, int a, int wanted, Value* base) {
    const CallInfo* call = L.m_Call;
    int count = static_cast<int>(call->m_Base - call->m_Function) - p->m_ParameterCount - 1;
    if (count < 0) count = 0;
    if (wanted == kAllResults) {
        L.m_Top = L.m_Call->m_Top;
        L.Charge(static_cast<size_t>(count) / 8);
        L.NeedStack(count);
        base = L.m_Base;
        wanted = count;
        L.m_Top = base + a + count;
    }
    for (int i = 0; i < wanted; i++) base[a + i] = i < count ? base[i - count] : g_Nil;
    return base;
}

// Puts the called function into the frame of the one that calls it last.
void ReuseFrame(State& L) {
    CallInfo* caller = L.m_Call - 1;
    CallInfo* called = L.m_Call;
    if (L.m_OpenUpValues) L.CloseUpValues(caller->m_Base);
    Value* function = caller->m_Function;
    ptrdiff_t distance = called->m_Function - function;
    L.m_Base = caller->m_Base = called->m_Base - distance;
    for (Value* p = called->m_Function; p < L.m_Top; p++) p[-distance] = *p;
    L.m_Top -= distance;
    caller->m_Top = L.m_Top;
    caller->m_Pc = called->m_Pc;
    caller->m_TailCalls++;
    L.m_Call--;
}

}  // namespace

#define A GetA(i)
#define RA (base + GetA(i))
#define RB (base + GetB(i))
#define RKB (IsConstant(GetB(i)) ? constants + GetConstantIndex(GetB(i)) : base + GetB(i))
#define RKC (IsConstant(GetC(i)) ? constants + GetConstantIndex(GetC(i)) : base + GetC(i))
#define SAVE (L.m_Call->m_Pc = pc)
#define NEXT                                           \
    do {                                               \
        if constexpr (kIsLimited) {                    \
            if (--L.GetMachine().m_Budget < 0) {       \
                SAVE;                                  \
                L.GetMachine().RaiseLimit();           \
            }                                          \
        }                                              \
        i = *pc++;                                     \
        goto* kLabels[static_cast<uint8_t>(GetOp(i))]; \
    } while (0)
// A jump always stands behind a test.
#define TAKE_JUMP (pc += GetSignedBx(*pc) + 1)
#define ARITHMETIC(op, expression)                   \
    do {                                             \
        const Value* left = RKB;                     \
        const Value* right = RKC;                    \
        if (left->IsNumber() && right->IsNumber()) { \
            double x = left->m_Number;               \
            double y = right->m_Number;              \
            *RA = Value::Number(expression);         \
        } else {                                     \
            SAVE;                                    \
            Arithmetic(L, op, left, right, RA);      \
            base = L.m_Base;                         \
        }                                            \
        NEXT;                                        \
    } while (0)

template <bool kIsLimited>
static void Run(State& L) {
    static const void* const kLabels[] = {
        &&Move,      &&LoadK,    &&LoadBool, &&LoadNil,  &&GetUpVal, &&GetGlobal, &&GetTable,
        &&SetGlobal, &&SetUpVal, &&SetTable, &&NewTable, &&Self,     &&Add,       &&Sub,
        &&Mul,       &&Div,      &&Mod,      &&Pow,      &&Unm,      &&Not,       &&Len,
        &&Concat_,   &&Jmp,      &&Eq,       &&Lt,       &&Le,       &&Test,      &&TestSet,
        &&Call,      &&TailCall, &&Return,   &&ForLoop,  &&ForPrep,  &&TForLoop,  &&SetList,
        &&Close,     &&Closure_, &&Vararg,   &&PreloadK, &&TForPrep,
    };
    static_assert(std::size(kLabels) == kOpCount);
    ScriptClosure* closure;
    const Value* constants;
    const Value* constant;  // of an instruction with any number of them
    Value* base;
    const Instruction* pc;
    Instruction i;

Enter:
    closure = AsScript(L.m_Call->m_Function->AsFunction());
    constants = closure->m_Prototype->m_Constants;
    base = L.m_Base;
    pc = L.m_Call->m_Pc;
    NEXT;

Move:
    *RA = *RB;
    NEXT;
LoadK:
    *RA = constants[GetBx(i)];
    NEXT;
LoadBool:
    *RA = Value::Boolean(GetB(i) != 0);
    if (GetC(i)) pc++;
    NEXT;
LoadNil:
    for (Value *p = RA, *end = RB; p <= end; p++) *p = g_Nil;
    NEXT;
GetUpVal:
    *RA = *closure->GetUpValues()[GetB(i)]->m_Place;
    NEXT;
GetGlobal:
    constant = constants + GetBx(i);
ReadGlobal : {
    Table* globals = closure->m_Environment;
    if constexpr (kIsLimited) {
        SAVE;
        L.ChargeAccess(globals);
    }
    const Value* found = globals->Get(constant->AsString());
    if (!found->IsNil()) {
        *RA = *found;
        NEXT;
    }
    SAVE;
    L.GetIndex(Value::Of(globals), *constant, RA);
    base = L.m_Base;
    NEXT;
}
SetGlobal:
    constant = constants + GetBx(i);
WriteGlobal:
    SAVE;
    L.SetIndex(Value::Of(closure->m_Environment), *constant, *RA);
    base = L.m_Base;
    NEXT;
GetTable : {
    const Value* object = RB;
    const Value* key = RKC;
    if (object->IsTable()) {
        const Table* table = object->AsTable();
        if constexpr (kIsLimited) {
            SAVE;
            L.ChargeAccess(table);
        }
        const Value* found = GetFast(table, key);
        if (!found->IsNil() || HasNo(L, table, Event::Index)) {
            *RA = *found;
            NEXT;
        }
    }
    SAVE;
    L.GetIndex(*object, *key, RA);
    base = L.m_Base;
    NEXT;
}
SetUpVal : {
    UpValue* upValue = closure->GetUpValues()[GetB(i)];
    *upValue->m_Place = *RA;
    L.GetMachine().Barrier(upValue, *RA);
    NEXT;
}
SetTable : {
    const Value* object = RA;
    const Value* key = RKB;
    const Value* value = RKC;
    if (object->IsTable()) {
        Table* table = object->AsTable();
        if constexpr (kIsLimited) {
            SAVE;
            L.ChargeAccess(table);
        }
        auto* slot = const_cast<Value*>(GetFast(table, key));
        if (!slot->IsNil() || (slot != &g_Nil && HasNo(L, table, Event::NewIndex))) {
            table->m_Absent = 0;
            *slot = *value;
            L.GetMachine().BarrierBack(table, *value);
            NEXT;
        }
    }
    SAVE;
    L.SetIndex(*object, *key, *value);
    base = L.m_Base;
    NEXT;
}
NewTable:
    SAVE;
    MakeTable(L, i, RA);
    L.GetMachine().CheckGc(L);
    base = L.m_Base;
    NEXT;
Self : {
    Value* object = RB;
    const Value* key = RKC;
    const Value self = *object;
    RA[1] = self;
    if (self.IsTable() && key->IsString()) {
        // A class is most often one table behind.
        const Table* table = self.AsTable();
        if constexpr (kIsLimited) {
            SAVE;
            L.ChargeAccess(table);
        }
        const Value* found = table->Get(key->AsString());
        if (!found->IsNil()) {
            *RA = *found;
            NEXT;
        }
        const Value* index = L.GetMachine().GetFastMeta(table->m_Metatable, Event::Index);
        if (index && index->IsTable()) {
            found = index->AsTable()->Get(key->AsString());
            if (!kIsLimited && !found->IsNil()) {
                *RA = *found;
                NEXT;
            }
        }
    }
    SAVE;
    L.GetIndex(*object, *key, RA);
    base = L.m_Base;
    NEXT;
}
Add:
    ARITHMETIC(Op::Add, x + y);
Sub:
    ARITHMETIC(Op::Sub, x - y);
Mul:
    ARITHMETIC(Op::Mul, x * y);
Div:
    ARITHMETIC(Op::Div, x / y);
Mod:
    ARITHMETIC(Op::Mod, FloorMod(x, y));
Pow:
    ARITHMETIC(Op::Pow, std::pow(x, y));
Unm : {
    const Value* operand = RB;
    if (operand->IsNumber()) {
        *RA = Value::Number(-operand->m_Number);
        NEXT;
    }
    SAVE;
    Arithmetic(L, Op::Unm, operand, operand, RA);
    base = L.m_Base;
    NEXT;
}
Not:
    *RA = Value::Boolean(RB->IsFalse());
    NEXT;
Len:
    SAVE;
    GetLengthOf(L, RB, RA);
    base = L.m_Base;
    NEXT;
Concat_ : {
    int first = GetB(i);
    int last = GetC(i);
    SAVE;
    L.m_Top = base + last + 1;
    Concat(L, last - first + 1);
    L.m_Top = L.m_Call->m_Top;
    base = L.m_Base;
    *RA = base[first];
    L.GetMachine().CheckGc(L);
    base = L.m_Base;
    NEXT;
}
Jmp:
    pc += GetSignedBx(i);
    NEXT;
Eq : {
    const Value* left = RKB;
    const Value* right = RKC;
    bool equal;
    if (left->m_Type != right->m_Type) {
        equal = false;
    } else if (left->IsNumber()) {
        equal = left->m_Number == right->m_Number;
    } else {
        SAVE;
        equal = EqualValues(L, left, right);
        base = L.m_Base;
    }
    if (equal == (A != 0)) {
        TAKE_JUMP;
    } else {
        pc++;
    }
    NEXT;
}
Lt : {
    const Value* left = RKB;
    const Value* right = RKC;
    bool less;
    if (left->IsNumber() && right->IsNumber()) {
        less = left->m_Number < right->m_Number;
    } else {
        SAVE;
        less = LessThan(L, left, right);
        base = L.m_Base;
    }
    if (less == (A != 0)) {
        TAKE_JUMP;
    } else {
        pc++;
    }
    NEXT;
}
Le : {
    const Value* left = RKB;
    const Value* right = RKC;
    bool less;
    if (left->IsNumber() && right->IsNumber()) {
        less = left->m_Number <= right->m_Number;
    } else {
        SAVE;
        less = LessEqual(L, left, right);
        base = L.m_Base;
    }
    if (less == (A != 0)) {
        TAKE_JUMP;
    } else {
        pc++;
    }
    NEXT;
}
Test:
    if (RA->IsFalse() != (GetC(i) != 0)) {
        TAKE_JUMP;
    } else {
        pc++;
    }
    NEXT;
TestSet : {
    const Value* value = RB;
    if (value->IsFalse() != (GetC(i) != 0)) {
        *RA = *value;
        TAKE_JUMP;
    } else {
        pc++;
    }
    NEXT;
}
Call : {
    int argEnd = GetB(i);
    int resultCount = GetC(i) - 1;
    Value* function = RA;
    if (argEnd != 0) L.m_Top = function + argEnd;
    SAVE;
    switch (L.Enter(function, resultCount)) {
        case State::Called::Script:
            goto Enter;
        case State::Called::Native:
            if (resultCount >= 0) L.m_Top = L.m_Call->m_Top;
            base = L.m_Base;
            NEXT;
        default:
            return;
    }
}
TailCall : {
    int argEnd = GetB(i);
    Value* function = RA;
    if (argEnd != 0) L.m_Top = function + argEnd;
    SAVE;
    switch (L.Enter(function, kAllResults)) {
        case State::Called::Script:
            ReuseFrame(L);
            goto Enter;
        case State::Called::Native:
            base = L.m_Base;
            NEXT;  // to the return behind
        default:
            return;
    }
}
Return : {
    Value* first = RA;
    int end = GetB(i);
    if (end != 0) L.m_Top = first + end - 1;
    if (L.m_OpenUpValues) L.CloseUpValues(base);
    bool isEntry = L.m_Call->m_IsEntry;
    bool isFixed = L.Leave(first);
    if (isEntry) return;
    if (isFixed) L.m_Top = L.m_Call->m_Top;
    goto Enter;
}
ForLoop : {
    Value* ra = RA;
    double step = ra[2].m_Number;
    double index = ra->m_Number + step;
    double limit = ra[1].m_Number;
    if (step > 0 ? index <= limit : limit <= index) {
        pc += GetSignedBx(i);
        ra[3] = *ra = Value::Number(index);
    }
    NEXT;
}
ForPrep:
    SAVE;
    PrepareFor(L, RA);
    pc += GetSignedBx(i);
    NEXT;
TForLoop : {
    Value* call = RA + 3;
    call[2] = call[-1];
    call[1] = call[-2];
    call[0] = call[-3];
    L.m_Top = call + 3;
    SAVE;
    L.CallAt(call, GetC(i));
    L.m_Top = L.m_Call->m_Top;
    base = L.m_Base;
    call = RA + 3;
    if (!call->IsNil()) {
        call[-1] = *call;
        TAKE_JUMP;
    } else {
        pc++;
    }
    NEXT;
}
SetList:
    SAVE;
    pc = StoreList(L, i, pc, RA);
    NEXT;
Close:
    L.CloseUpValues(RA);
    NEXT;
Closure_:
    SAVE;
    pc = MakeClosure(L, closure, i, pc, base);
    L.GetMachine().CheckGc(L);
    base = L.m_Base;
    NEXT;
Vararg:
    SAVE;
    base = PushVarargs(L, closure->m_Prototype, A, GetB(i) - 1, base);
    NEXT;
PreloadK : {
    size_t upperBits = static_cast<size_t>(GetBx(i)) << 18;
    i = *pc++;
    constant = constants + (upperBits | static_cast<size_t>(GetBx(i)));
    if (GetOp(i) == Op::GetGlobal) goto ReadGlobal;
    if (GetOp(i) == Op::SetGlobal) goto WriteGlobal;
    *RA = *constant;
    NEXT;
}
TForPrep:
    PrepareGenericFor(L, RA);
    pc += GetSignedBx(i);
    NEXT;
}

#undef A
#undef RA
#undef RB
#undef RKB
#undef RKC
#undef SAVE
#undef NEXT
#undef TAKE_JUMP
#undef ARITHMETIC

void Execute(State& L) {
    if (L.GetMachine().m_IsLimited) {
        Run<true>(L);
    } else {
        Run<false>(L);
    }
}

}  // namespace Korvel::TextForm

// The base library. Loading of chunks: BaseLib_Load.cpp; coroutines: CoroutineLib.cpp.
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "textform/BaseLibInternal.h"
#include "textform/Chars.h"
#include "textform/Interpreter.h"
#include "textform/Vm.h"

namespace Korvel::TextForm {

namespace {

int BasePrint(State& L) {
    int count = L.GetArgCount();
    L.PushString("tostring");
    L.GetIndex(Value::Of(L.m_Globals), L.m_Top[-1], L.m_Top - 1);
    for (int i = 1; i <= count; i++) {
        L.Push(L.m_Base[count]);
        L.Push(L.m_Base[i - 1]);
        L.Call(1, 1);
        if (!L.ToString(L.m_Top - 1)) L.Error("'tostring' must return a string to 'print'");
        L.Charge(L.m_Top[-1].AsString()->m_Length / 16);
        if (i > 1) putchar('\t');
        fputs(L.m_Top[-1].AsString()->GetText(), stdout);
        L.Pop();
    }
    putchar('\n');
    return 0;
}

int BaseToNumber(State& L) {
    auto base = static_cast<int>(L.OptInteger(2, 10));
    if (base == 10) {
        L.CheckAny(1);
        double number;
        if (!L.ReadNumber(L.Arg(1), number)) {
            L.PushNil();
        } else {
            L.PushNumber(number);
        }
        return 1;
    }
    const char* text = L.CheckString(1)->GetText();
    L.Charge(L.Arg(1).AsString()->m_Length / 64);
    if (base < 2 || base > 36) L.ArgError(2, "base out of range");
    char* end;
    unsigned long number = strtoul(text, &end, base);
    if (end == text) {
        L.PushNil();
        return 1;
    }
    while (IsSpace(static_cast<unsigned char>(*end))) end++;
    if (*end) {
        L.PushNil();
    } else {
        L.PushNumber(static_cast<double>(number));
    }
    return 1;
}

int BaseError(State& L) {
    auto level = static_cast<int>(L.OptInteger(2, 1));
    L.SetTop(1);
    if ((L.Arg(1).IsString() || L.Arg(1).IsNumber()) && level > 0) {
        L.PushWhere(level);
        L.Push(L.Arg(1));
        Concat(L, 2);
    }
    L.ThrowValue();
}

int BaseGetMetatable(State& L) {
    L.CheckAny(1);
    Table* metatable = L.GetMachine().GetMetatable(L.Arg(1));
    if (!metatable) {
        L.PushNil();
    } else if (!L.GetMetaField(1, "__metatable")) {
        L.Push(Value::Of(metatable));
    }
    return 1;
}

int BaseSetMetatable(State& L) {
    L.CheckTable(1);
    Type type = L.GetArgType(2);
    if (type != Type::Nil && type != Type::Table) L.ArgError(2, "nil or table expected");
    if (L.GetMetaField(1, "__metatable")) L.Error("cannot change a protected metatable");
    L.SetTop(2);
    Table* table = L.Arg(1).AsTable();
    table->m_Metatable = type == Type::Table ? L.Arg(2).AsTable() : nullptr;
    L.GetMachine().Barrier(table, table->m_Metatable);
    L.Pop();
    return 1;
}

// The function of an argument that is one or the level of one; pushed. Nil for a level lost in a
// tail call.
void PushFunctionAt(State& L, bool isOptional) {
    if (L.Arg(1).IsFunction()) {
        L.Push(L.Arg(1));
        return;
    }
    auto level =
        isOptional ? static_cast<int>(L.OptInteger(1, 1)) : static_cast<int>(L.CheckInteger(1));
    if (level < 0) L.ArgError(1, "level must be non-negative");
    State::Level found;
    if (!L.GetLevel(level, found)) L.ArgError(1, "invalid level");
    L.Push(found.m_Call ? *found.m_Call->m_Function : g_Nil);
    if (L.m_Top[-1].IsNil()) {
        L.Error("no function environment for tail call at level %d", level);
    }
}

int BaseGetFenv(State& L) {
    PushFunctionAt(L, true);
    Closure* c = L.m_Top[-1].AsFunction();
    L.Push(Value::Of(c->IsNative() ? L.m_Globals : c->m_Environment));
    return 1;
}

int BaseSetFenv(State& L) {
    Table* environment = L.CheckTable(2);
    PushFunctionAt(L, false);
    double level;
    if (State::ToNumber(L.Arg(1), level) && level == 0) {  // the thread's own
        L.m_Globals = environment;
        L.GetMachine().Barrier(&L, environment);
        return 0;
    }
    Closure* c = L.m_Top[-1].AsFunction();
    if (c->IsNative()) L.Error("'setfenv' cannot change environment of given object");
    c->m_Environment = environment;
    L.GetMachine().Barrier(c, environment);
    return 1;
}

int BaseRawEqual(State& L) {
    L.CheckAny(1);
    L.CheckAny(2);
    L.PushBoolean(RawEquals(L.Arg(1), L.Arg(2)));
    return 1;
}

int BaseRawGet(State& L) {
    Table* table = L.CheckTable(1);
    L.CheckAny(2);
    L.ChargeAccess(table);
    L.Push(*table->Get(L.Arg(2)));
    return 1;
}

int BaseRawSet(State& L) {
    Table* table = L.CheckTable(1);
    L.CheckAny(2);
    L.CheckAny(3);
    L.SetTop(3);
    L.SetRaw(table, L.Arg(2), L.Arg(3));
    L.SetTop(1);
    return 1;
}

int BaseGcInfo(State& L) {
    L.PushNumber(static_cast<double>(L.GetMachine().m_Heap.GetUsed() >> 10));
    return 1;
}

int BaseCollectGarbage(State& L) {
    static constexpr const char* kOptions[] = {"stop", "restart",  "collect",    "count",
                                               "step", "setpause", "setstepmul", nullptr};
    Machine& machine = L.GetMachine();
    int option = L.CheckOption(1, "collect", kOptions);
    auto value = static_cast<int>(L.OptInteger(2, 0));
    double result = 0;
    switch (option) {
        case 0:
            machine.StopGc();
            break;
        case 1:
            machine.RestartGc();
            break;
        case 2:
            machine.CollectAll(L);
            break;
        case 3:
            L.PushNumber(static_cast<double>(machine.m_Heap.GetUsed()) / 1024);
            return 1;
        case 4:
            L.PushBoolean(machine.StepGcBy(L, value));
            return 1;
        case 5:
            result = machine.m_Pause;
            machine.m_Pause = value;
            break;
        default:
            result = machine.m_StepFactor;
            machine.m_StepFactor = value;
    }
    L.PushNumber(result);
    return 1;
}

int BaseType(State& L) {
    L.CheckAny(1);
    L.PushString(GetTypeName(L.GetArgType(1)));
    return 1;
}

int BaseNext(State& L) {
    Table* table = L.CheckTable(1);
    L.SetTop(2);
    L.PushNil();
    if (Next(L, table, L.m_Base + 1)) return 2;
    L.SetTop(1);
    L.PushNil();
    return 1;
}

int BasePairs(State& L) {
    L.CheckTable(1);
    L.Push(L.GetUpValue(1));
    L.Push(L.Arg(1));
    L.PushNil();
    return 3;
}

int IpairsStep(State& L) {
    Table* table = L.CheckTable(1);
    auto i = static_cast<int>(L.CheckInteger(2) + 1);
    L.ChargeAccess(table);
    const Value value = *table->Get(i);
    L.PushNumber(i);
    L.Push(value);
    return value.IsNil() ? 0 : 2;
}

int BaseIpairs(State& L) {
    L.CheckTable(1);
    L.Push(L.GetUpValue(1));
    L.Push(L.Arg(1));
    L.PushNumber(0);
    return 3;
}

int BaseAssert(State& L) {
    L.CheckAny(1);
    if (L.Arg(1).IsFalse()) {
        L.Error("%s", L.OptString(2, "assertion failed!").data());
    }
    return L.GetArgCount();
}

int BaseUnpack(State& L) {
    Table* table = L.CheckTable(1);
    auto first = static_cast<int>(L.OptInteger(2, 1));
    int last = L.IsNoneOrNil(3) ? GetLength(table) : static_cast<int>(L.CheckInteger(3));
    if (first > last) return 0;
    int64_t count = static_cast<int64_t>(last) - first + 1;
    if (count > State::kMaxNativeStack || !L.TryNeedStack(static_cast<int>(count))) {
        L.Error("too many results to unpack");
    }
    L.Charge(static_cast<size_t>(count) / 8);
    for (int64_t i = first; i <= last; i++) {
        L.ChargeAccess(table);
        L.Push(*table->Get(static_cast<int>(i)));
    }
    return static_cast<int>(count);
}

int BaseSelect(State& L) {
    int count = L.GetArgCount();
    if (L.Arg(1).IsString() && *L.Arg(1).AsString()->GetText() == '#') {
        L.PushNumber(count - 1);
        return 1;
    }
    auto i = static_cast<int>(L.CheckInteger(1));
    if (i < 0) {
        i += count;
    } else if (i > count) {
        i = count;
    }
    if (i < 1) L.ArgError(1, "index out of range");
    return count - i;
}

// A limit that was hit is no error that a program handles.
Status PassLimit(State& L, Status status) {
    if (status == Status::LimitError) L.Throw(status);
    return status;
}

int BasePcall(State& L) {
    L.CheckAny(1);
    Status status = PassLimit(L, L.ProtectedCall(L.GetArgCount() - 1, kAllResults));
    L.PushBoolean(status == Status::Ok);
    L.Insert(1);
    return L.GetArgCount();
}

int BaseXpcall(State& L) {
    L.CheckAny(2);
    L.SetTop(2);
    L.Insert(1);  // the handler stands below
    Status status = PassLimit(L, L.ProtectedCall(0, kAllResults, L.m_Base));
    L.PushBoolean(status == Status::Ok);
    L.m_Base[0] = L.m_Top[-1];
    L.Pop();
    return L.GetArgCount();
}

int BaseToString(State& L) {
    L.CheckAny(1);
    if (L.CallMeta(1, "__tostring")) return 1;
    const Value value = L.Arg(1);
    switch (value.m_Type) {
        case Type::String:
        case Type::Number:
            L.Push(value);
            L.ToString(L.m_Top - 1);
            break;
        case Type::Boolean:
            L.PushString(value.m_Boolean ? "true" : "false");
            break;
        case Type::Nil:
            L.PushString("nil");
            break;
        default:
            L.PushFormat(
                "%s: %p", GetTypeName(value.m_Type),
                value.Is(Type::Userdata) ? value.AsUserdata()->GetData() : value.m_Pointer);
    }
    return 1;
}

// A userdata without data: with no metatable, a new one, or that of another such userdata. The
// metatables made here are remembered in a weak table.
int BaseNewProxy(State& L) {
    L.SetTop(1);
    Userdata* proxy = NewUserdata(L.GetMachine(), 0, L.m_Globals);
    L.Push(Value::Of(static_cast<Object*>(proxy)));
    const Value& model = L.Arg(1);
    if (model.IsFalse()) return 1;
    Table* known = L.GetUpValue(1).AsTable();
    Table* metatable;
    if (model.Is(Type::Boolean)) {
        metatable = L.PushTable();
        L.SetRaw(known, Value::Of(metatable), Value::Boolean(true));
        L.Pop();
    } else {
        metatable = L.GetMachine().GetMetatable(model);
        if (!metatable || known->Get(Value::Of(metatable))->IsNil()) {
            L.ArgError(1, "boolean or proxy expected");
        }
    }
    proxy->m_Metatable = metatable;
    L.GetMachine().Barrier(proxy, metatable);
    return 1;
}

// ---- The dialect's own

double ToNumberOr0(const Value& value) {
    double number;
    return State::ToNumber(value, number) ? number : 0;
}

int BaseSetHashState(State& L) {
    L.m_HashState = static_cast<uint8_t>(ToInt64(ToNumberOr0(L.Arg(1))));
    return 0;
}

int BaseGetTableFlags(State& L) {
    L.PushNumber(L.CheckTable(1)->m_Flags);
    return 1;
}

// Where keys stand depends on bit 0, so it stays while there are any.
int BaseSetTableFlags(State& L) {
    Table* table = L.CheckTable(1);
    auto value = static_cast<uint32_t>(ToInt64(ToNumberOr0(L.Arg(2))));
    auto mask = static_cast<uint32_t>(ToInt64(ToNumberOr0(L.Arg(3))));
    if (table->HasNodes()) mask &= ~Table::kHashed;
    table->m_Flags = (value & mask) | (table->m_Flags & ~mask);
    return 0;
}

void PushIterator(State& L, const char* name, NativeFunction function, NativeFunction step) {
    L.PushFunction(step);
    L.PushFunction(function, 1);
    L.SetField(L.m_Globals, name, L.m_Top[-1]);
    L.Pop();
}

constexpr NativeEntry kFunctions[] = {
    {"assert", BaseAssert},
    {"collectgarbage", BaseCollectGarbage},
    {"error", BaseError},
    {"gcinfo", BaseGcInfo},
    {"getfenv", BaseGetFenv},
    {"getmetatable", BaseGetMetatable},
    {"next", BaseNext},
    {"pcall", BasePcall},
    {"print", BasePrint},
    {"rawequal", BaseRawEqual},
    {"rawget", BaseRawGet},
    {"rawset", BaseRawSet},
    {"select", BaseSelect},
    {"setfenv", BaseSetFenv},
    {"setmetatable", BaseSetMetatable},
    {"tonumber", BaseToNumber},
    {"tostring", BaseToString},
    {"type", BaseType},
    {"unpack", BaseUnpack},
    {"xpcall", BaseXpcall},
    {"sethashstate", BaseSetHashState},
    {"gettableflags", BaseGetTableFlags},
    {"settableflags", BaseSetTableFlags},
};

}  // namespace

void OpenBase(State& L, BaseLevel level) {
    Machine::GcPause pause(L.GetMachine());
    Table* globals = L.m_Globals;
    L.SetField(globals, "_G", Value::Of(globals));
    Register(L, globals, kFunctions);
    L.PushString("Lua 5.1");
    L.SetField(globals, "_VERSION", L.m_Top[-1]);
    L.Pop();
    PushIterator(L, "ipairs", BaseIpairs, IpairsStep);
    PushIterator(L, "pairs", BasePairs, BaseNext);
    if (level == BaseLevel::Foreign) {
        L.SetField(globals, "print", Value::Nil());
        return;
    }
    RegisterLoading(L);
    Table* known = L.PushTable();
    known->m_Metatable = known;
    L.PushString("kv");
    L.SetField(known, "__mode", L.m_Top[-1]);
    L.Pop();
    L.PushFunction(BaseNewProxy, 1);
    L.SetField(globals, "newproxy", L.m_Top[-1]);
    L.Pop();
    OpenCoroutine(L);
}

}  // namespace Korvel::TextForm

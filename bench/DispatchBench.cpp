// A member call by name, with a number for an argument and a number for a result: what it takes as
// a whole and in its parts, beside other ways to call by name. The heap is watched meanwhile.
#include <cstddef>
#include <cstdio>
#include <functional>
#include <string>
#include <unordered_map>

#include "Compare.h"
#include "core/RefObject.h"
#include "objects/Publish.h"

#ifdef KORVEL_BENCH_GOBJECT
#include <glib-object.h>
#endif
#ifdef KORVEL_BENCH_QT
void QtInvoke(benchmark::State& state);
#endif

namespace {

using namespace Korvel;

// Counts what reaches the heap: the names are found here before those of the C library.
unsigned long s_HeapCalls = 0;

}  // namespace

extern "C" {

void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* p, size_t size);

void* malloc(size_t size) {
    s_HeapCalls++;
    return __libc_malloc(size);
}
void* calloc(size_t count, size_t size) {
    s_HeapCalls++;
    return __libc_calloc(count, size);
}
void* realloc(void* p, size_t size) {
    s_HeapCalls++;
    return __libc_realloc(p, size);
}

}  // extern "C"

namespace {

// A class as they are: some members of its own, some of its base class.
class Base : public Scripted<RefObject> {
    KORVEL_SCRIPTED(Base)
public:
    Base() { SetScriptClass(); }

protected:
    double m_Value = 0;
};

KORVEL_PUBLISH(Base, "Base", "", "")
KORVEL_FUNCTION(Base, AddToBase, SSF_AnyThread) {
    args.ReturnNumber(self.m_Value += args[1].ToNumber());
}
KORVEL_FUNCTION(Base, Open, 0) {}
KORVEL_FUNCTION(Base, Close, 0) {}
KORVEL_VARIABLE(Base, Title, SSF_Read) {}
KORVEL_PUBLISHED(Base);

class Derived : public Base {
    KORVEL_SCRIPTED(Derived)
public:
    Derived() { SetScriptClass(); }
};

KORVEL_PUBLISH(Derived, "Derived", "", "")
KORVEL_FUNCTION(Derived, Play, 0) {}
KORVEL_FUNCTION(Derived, Add, 0) {
    args.ReturnNumber(self.m_Value += args[1].ToNumber());
}
KORVEL_FUNCTION(Derived, Nothing, 0) {}
KORVEL_FUNCTION(Derived, Stop, 0) {}
KORVEL_VARIABLE(Derived, Position, SSF_Read | SSF_Write) {}
KORVEL_VARIABLE(Derived, Length, SSF_Read) {}
KORVEL_PUBLISHED(Derived);

template <const char* const& name>
void Invoke(benchmark::State& state) {
    Derived object;
    for (auto _ : state) benchmark::DoNotOptimize(object.Invoke(name, 1.5).ToNumber());
}

template <const char* const& name>
void LookUp(benchmark::State& state) {
    Derived object;
    ScriptInfo* info = object.GetScriptInfo();
    for (auto _ : state) benchmark::DoNotOptimize(info->FindSymbol(name, 0));
}

void Values(benchmark::State& state) {
    for (auto _ : state) {
        ScriptArgs args;
        args.SetArguments(1.5);
        args.ReturnNumber(args[1].ToNumber());
        benchmark::DoNotOptimize(args.TakeResult().ToNumber());
    }
}

void CallAlone(benchmark::State& state) {
    Derived object;
    ScriptArgs args;
    ScriptSymbol* symbol = object.GetScriptInfo()->FindSymbol("Nothing", 0);
    for (auto _ : state) symbol->Call(&object, args, false);
}

// The same through the function value that a script holds.
void FunctionValue(benchmark::State& state) {
    Derived object;
    ScriptInfo* info = object.GetScriptInfo();
    auto address = reinterpret_cast<uint64_t>(info->FindSymbol("Nothing", 0));
    ScriptArgs args;
    args[0] = ScriptVal(SV_Function, &address);
    ScriptSymbol* symbol = info->FindSymbol(nullptr, SST_CallFunction);
    for (auto _ : state) symbol->Call(&object, args, false);
}

const char* const s_Own = "Add";
const char* const s_Inherited = "AddToBase";

// What each of the others has by that name.
double s_Total = 0;
double AddToTotal(double value) {
    return s_Total += value;
}

void MapOfFunctions(benchmark::State& state) {
    std::unordered_map<std::string, std::function<double(double)>> members;
    for (const char* name : {"Play", "Nothing", "Stop", "Position", "Length", "Open", "Close"}) {
        members[name] = [](double value) { return value; };
    }
    members["Add"] = AddToTotal;
    const char* name = s_Own;
    for (auto _ : state) {
        benchmark::DoNotOptimize(name);
        benchmark::DoNotOptimize(members.find(name)->second(1.5));
    }
}

#ifdef KORVEL_BENCH_GOBJECT
void Marshal(GClosure* closure, GValue* result, guint, const GValue* values, gpointer, gpointer) {
    auto function =
        reinterpret_cast<double (*)(double)>(reinterpret_cast<GCClosure*>(closure)->callback);
    g_value_set_double(result, function(g_value_get_double(values)));
}

void GObjectClosure(benchmark::State& state) {
    GClosure* closure = g_cclosure_new(G_CALLBACK(AddToTotal), nullptr, nullptr);
    g_closure_set_marshal(closure, Marshal);
    g_closure_ref(closure);
    g_closure_sink(closure);
    for (auto _ : state) {
        GValue argument = G_VALUE_INIT;
        GValue result = G_VALUE_INIT;
        g_value_init(&argument, G_TYPE_DOUBLE);
        g_value_init(&result, G_TYPE_DOUBLE);
        g_value_set_double(&argument, 1.5);
        g_closure_invoke(closure, &result, 1, &argument, nullptr);
        benchmark::DoNotOptimize(g_value_get_double(&result));
        g_value_unset(&argument);
        g_value_unset(&result);
    }
    g_closure_unref(closure);
}
#endif

void CountHeapCalls() {
    constexpr int kCalls = 1000000;
    Derived object;
    object.Invoke(s_Own, 1.5);  // fills the thread's pools
    unsigned long before = s_HeapCalls;
    for (int i = 0; i < kCalls; i++) object.Invoke(s_Own, 1.5);
    printf("\nheap allocations in %d calls: %lu\n", kCalls, s_HeapCalls - before);
}

}  // namespace

int main(int argc, char** argv) {
    benchmark::RegisterBenchmark("call by name@korvelscript", Invoke<s_Own>);
    benchmark::RegisterBenchmark("call by name@map of functions", MapOfFunctions);
#ifdef KORVEL_BENCH_GOBJECT
    benchmark::RegisterBenchmark("call by name@GObject closure", GObjectClosure);
#endif
#ifdef KORVEL_BENCH_QT
    benchmark::RegisterBenchmark("call by name@Qt invokeMethod", QtInvoke);
#endif
    benchmark::RegisterBenchmark("call by name, inherited@korvelscript", Invoke<s_Inherited>);
    benchmark::RegisterBenchmark("  of it, look-up@korvelscript", LookUp<s_Own>);
    benchmark::RegisterBenchmark("  of it, look-up, inherited@korvelscript", LookUp<s_Inherited>);
    benchmark::RegisterBenchmark("  of it, values@korvelscript", Values);
    benchmark::RegisterBenchmark("  of it, call@korvelscript", CallAlone);
    benchmark::RegisterBenchmark("call of a function value@korvelscript", FunctionValue);
    int status = Korvel::Bench::RunComparison(argc, argv);
    if (status == 0) CountHeapCalls();
    return status;
}

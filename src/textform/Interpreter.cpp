#include "textform/Interpreter.h"

#include <new>

#include "textform/Lexer.h"

namespace Korvel::TextForm {

namespace {

void MakeNames(Machine& machine) {
    static constexpr const char* kNames[] = {"__index",  "__newindex", "__gc",  "__mode", "__eq",
                                             "__add",    "__sub",      "__mul", "__div",  "__mod",
                                             "__pow",    "__unm",      "__len", "__lt",   "__le",
                                             "__concat", "__call",     "__iter"};
    static_assert(std::size(kNames) == static_cast<size_t>(Event::Count));
    auto keep = [&](const char* text) {
        String* string = machine.NewString(text);
        string->m_Marks |= Machine::kFixed;
        return string;
    };
    for (size_t i = 0; i < std::size(kNames); i++) machine.m_EventNames[i] = keep(kNames[i]);
    machine.m_MemoryMessage = keep("not enough memory");
    machine.m_HandlerMessage = keep("error in error handling");
    machine.m_LimitMessage = keep("too many instructions");
}

}  // namespace

Interpreter::Interpreter(const Limits* limits) {
    try {
        State* L = m_Machine.m_MainThread = NewThread(m_Machine, nullptr);
        L->m_Globals = NewTable(*L, 0, 2);
        m_Machine.m_Registry = NewTable(*L, 0, 2);
        MakeNames(m_Machine);
        InitReservedWords(m_Machine);
        m_Machine.m_Threshold = 4 * m_Machine.m_Heap.GetUsed();
    } catch (const Raised&) {
        throw std::bad_alloc();
    }
    if (limits) {
        m_Machine.m_IsLimited = true;
        m_Machine.m_Budget = limits->m_Instructions;
        m_Machine.m_Heap.SetLimit(limits->m_Bytes);
    }
}

Interpreter::~Interpreter() {
    State& L = GetState();
    L.CloseUpValues(L.m_Stack);
    L.m_Call = L.m_Calls;
    L.m_Base = L.m_Top = L.m_Call->m_Base;
    L.m_NativeCalls = 0;
    Machine::GcPause pause(m_Machine);
    m_Machine.ReleaseUserdata();  // once: what finalisers make goes without
    Status status;
    do {  // a finaliser that fails is no reason to leave the others out
        status = L.RunProtected([&] { m_Machine.RunWaitingFinalizers(L); }, L.m_Base, 0);
        L.m_Top = L.m_Base;
    } while (status != Status::Ok && status != Status::LimitError);
}

void Register(State& L, Table* table, std::span<const NativeEntry> entries) {
    for (const NativeEntry& entry : entries) {
        NativeClosure* c = NewNativeClosure(L.GetMachine(), entry.m_Function, 0, L.m_Globals);
        L.SetField(table, entry.m_Name, Value::Of(static_cast<Closure*>(c)));
    }
}

Table* OpenLibrary(State& L, const char* name, std::span<const NativeEntry> entries) {
    Machine::GcPause pause(L.GetMachine());
    Table* table = L.PushTable(0, static_cast<int>(entries.size()));
    L.SetField(L.m_Globals, name, Value::Of(table));
    Register(L, table, entries);
    return table;
}

}  // namespace Korvel::TextForm

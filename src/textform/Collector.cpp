// The collector: marks what can be reached and sweeps the rest, a little at a time.
//
// White objects were not reached yet, gray ones wait for a look at what they refer to, black ones
// are done. No black object refers to a white one; the barriers see to that while programs run in
// between. There are two whites: those of the last cycle are what a sweep frees.
#include <algorithm>
#include <utility>

#include "textform/State.h"

namespace Korvel::TextForm {

namespace {

constexpr size_t kStepSize = 4096;
constexpr int kSweepCount = 64;
constexpr size_t kSweepCost = 10;
constexpr size_t kFinalizerCost = 100;

Object*& GetGrayLink(Object* object) {
    switch (object->m_Type) {
        case Type::Table:
            return static_cast<Table*>(object)->m_GcList;
        case Type::Function:
            return static_cast<Closure*>(object)->m_GcList;
        case Type::Prototype:
            return static_cast<Prototype*>(object)->m_GcList;
        default:
            return static_cast<State*>(object)->m_GcList;
    }
}

void RemoveEntry(Node& node) {
    node.m_Value = g_Nil;
    if (node.m_Key.m_Type >= Type::String) node.m_Key.m_Type = Type::DeadKey;
}

// Whether a weak table loses the entry of this key or value. Strings are values to programs, not
// objects: they stay, and are marked at last.
bool IsCleared(const Value& value, bool isKey) {
    if (!value.IsObject()) return false;
    if (value.IsString()) {
        value.m_Object->m_Marks &= static_cast<uint8_t>(~Machine::kWhites);
        return false;
    }
    return Machine::IsWhite(value.m_Object) ||
           (value.Is(Type::Userdata) && !isKey && (value.m_Object->m_Marks & Machine::kFinalized));
}

}  // namespace

// ---- Marking

void Machine::LinkGray(Object* object, Object*& list) {
    GetGrayLink(object) = list;
    list = object;
}

void Machine::MarkObject(Object* object) {
    object->m_Marks &= static_cast<uint8_t>(~kWhites);
    switch (object->m_Type) {
        case Type::String:
            return;
        case Type::Userdata: {
            auto* userdata = static_cast<Userdata*>(object);
            object->m_Marks |= kBlack;
            MarkIf(userdata->m_Metatable);
            MarkIf(userdata->m_Environment);
            return;
        }
        case Type::UpValue: {
            auto* upValue = static_cast<UpValue*>(object);
            Mark(*upValue->m_Place);
            if (!upValue->m_Link) object->m_Marks |= kBlack;  // an open one may still change
            return;
        }
        default:
            LinkGray(object, m_Gray);
    }
}

void Machine::BarrierObject(Object* owner, Object* value) {
    if (m_Phase == Phase::Mark) {
        MarkObject(value);
    } else {
        MakeWhite(owner);  // saves other barriers; the sweep would do the same
    }
}

void Machine::BarrierBack(Table* table, const Value& value) {
    if (!value.IsObject() || !IsBlack(table) || !IsWhite(value.m_Object)) return;
    table->m_Marks &= static_cast<uint8_t>(~kBlack);
    LinkGray(table, m_GrayAgain);
}

void Machine::BarrierClosed(UpValue* upValue) {
    if (IsWhite(upValue)) return;
    if (m_Phase == Phase::Mark) {
        upValue->m_Marks |= kBlack;
        Mark(upValue->m_Closed);
    } else {
        MakeWhite(upValue);
    }
}

void Machine::StartCycle() {
    m_Gray = m_GrayAgain = m_Weak = nullptr;
    MarkIf(m_MainThread);
    MarkIf(m_MainThread->m_Globals);
    MarkIf(m_Registry);
    for (Table* metatable : m_TypeMetatables) MarkIf(metatable);
    m_Phase = Phase::Mark;
}

size_t Machine::Traverse(Table* table) {
    MarkIf(table->m_Metatable);
    bool weakKeys = false;
    bool weakValues = false;
    const Value* mode = GetFastMeta(table->m_Metatable, Event::Mode);
    if (mode && mode->IsString()) {
        const char* letters = mode->AsString()->GetText();
        weakKeys = strchr(letters, 'k') != nullptr;
        weakValues = strchr(letters, 'v') != nullptr;
        if (weakKeys || weakValues) {
            table->m_Marks &= static_cast<uint8_t>(~(kWeakKeys | kWeakValues | kBlack));
            if (weakKeys) table->m_Marks |= kWeakKeys;
            if (weakValues) table->m_Marks |= kWeakValues;
            LinkGray(table, m_Weak);
        }
    }
    size_t size =
        sizeof(Table) + table->m_ArraySize * sizeof(Value) + table->CountNodes() * sizeof(Node);
    if (weakKeys && weakValues) return size;
    if (!weakValues) {
        for (int i = 0; i < table->m_ArraySize; i++) Mark(table->m_Array[i]);
    }
    if (!table->HasNodes()) return size;
    for (int i = 0, count = table->CountNodes(); i < count; i++) {
        Node& node = table->m_Nodes[i];
        if (node.m_Value.IsNil()) {
            RemoveEntry(node);
            continue;
        }
        if (!weakKeys) Mark(node.m_Key.Get());
        if (!weakValues) Mark(node.m_Value);
    }
    return size;
}

size_t Machine::Traverse(Closure* closure) {
    MarkIf(closure->m_Environment);
    int count = closure->m_UpValueCount;
    if (closure->IsNative()) {
        for (int i = 0; i < count; i++) Mark(AsNative(closure)->GetUpValues()[i]);
        return sizeof(NativeClosure) + count * sizeof(Value);
    }
    MarkIf(AsScript(closure)->m_Prototype);
    for (int i = 0; i < count; i++) MarkIf(AsScript(closure)->GetUpValues()[i]);
    return sizeof(ScriptClosure) + count * sizeof(UpValue*);
}

size_t Machine::Traverse(Prototype* p) {
    MarkIf(p->m_Source);
    for (int i = 0; i < p->m_ConstantCount; i++) Mark(p->m_Constants[i]);
    for (int i = 0; i < p->m_UpValueNameCount; i++) MarkIf(p->m_UpValueNames[i]);
    for (int i = 0; i < p->m_PrototypeCount; i++) MarkIf(p->m_Prototypes[i]);
    for (int i = 0; i < p->m_LocalCount; i++) MarkIf(p->m_Locals[i].m_Name);
    return sizeof(Prototype) + p->m_CodeCount * sizeof(Instruction) +
           p->m_ConstantCount * sizeof(Value) + p->m_LocalCount * sizeof(LocalVariable) +
           p->m_LineCount * sizeof(int);
}

// A stack changes without barriers, so a thread stays gray until the end.
size_t Machine::Traverse(State* thread) {
    thread->m_Marks &= static_cast<uint8_t>(~kBlack);
    LinkGray(thread, m_GrayAgain);
    MarkIf(thread->m_Globals);
    Value* end = thread->m_Top;
    for (CallInfo* call = thread->m_Calls; call <= thread->m_Call; call++) {
        end = std::max(end, call->m_Top);
    }
    Value* place = thread->m_Stack;
    for (; place < thread->m_Top; place++) Mark(*place);
    end = std::min(end, thread->m_Stack + thread->m_StackSize - 1);
    for (Value* p = place; p <= end; p++) *p = g_Nil;
    thread->ShrinkStacks(end);
    return sizeof(State) + thread->m_StackSize * sizeof(Value);
}

size_t Machine::TraverseOne() {
    Object* object = m_Gray;
    m_Gray = GetGrayLink(object);
    object->m_Marks |= kBlack;
    switch (object->m_Type) {
        case Type::Table:
            return Traverse(static_cast<Table*>(object));
        case Type::Function:
            return Traverse(static_cast<Closure*>(object));
        case Type::Prototype:
            return Traverse(static_cast<Prototype*>(object));
        default:
            return Traverse(static_cast<State*>(object));
    }
}

size_t Machine::TraverseAll() {
    size_t size = 0;
    while (m_Gray) size += TraverseOne();
    return size;
}

// Up-values that are reachable, open on a thread that may not be.
void Machine::RemarkUpValues() {
    for (State* thread = m_Threads; thread; thread = thread->m_NextThread) {
        for (UpValue* open = thread->m_OpenUpValues; open; open = open->m_NextOpen) {
            if (!IsWhite(open)) Mark(*open->m_Place);
        }
    }
}

// Moves userdata that nobody reaches and that has a finaliser to the list of those to call; returns
// its size.
size_t Machine::SeparateUserdata(bool all) {
    size_t size = 0;
    Object** link = &m_Userdata;
    while (Object* object = *link) {
        auto* userdata = static_cast<Userdata*>(object);
        if ((object->m_Marks & kFinalized) || !(all || IsWhite(object))) {
            link = &object->m_Next;
            continue;
        }
        object->m_Marks |= kFinalized;
        if (!GetFastMeta(userdata->m_Metatable, Event::Gc)) {
            link = &object->m_Next;
            continue;
        }
        size += sizeof(Userdata) + userdata->m_Size;
        *link = object->m_Next;
        if (m_ToFinalize) {
            object->m_Next = m_ToFinalize->m_Next;
            m_ToFinalize->m_Next = object;
        } else {
            object->m_Next = object;
        }
        m_ToFinalize = object;
    }
    return size;
}

void Machine::ClearWeakTables() {
    for (Object* object = m_Weak; object; object = GetGrayLink(object)) {
        auto* table = static_cast<Table*>(object);
        if (table->m_Marks & kWeakValues) {
            for (int i = 0; i < table->m_ArraySize; i++) {
                if (IsCleared(table->m_Array[i], false)) table->m_Array[i] = g_Nil;
            }
        }
        if (!table->HasNodes()) continue;
        for (int i = 0, count = table->CountNodes(); i < count; i++) {
            Node& node = table->m_Nodes[i];
            if (node.m_Value.IsNil()) continue;
            if (IsCleared(node.m_Key.Get(), true) || IsCleared(node.m_Value, false)) {
                RemoveEntry(node);
            }
        }
    }
}

// The part of a cycle that has to happen at once.
void Machine::FinishMarking(State& L) {
    RemarkUpValues();
    TraverseAll();
    m_Gray = m_Weak;
    m_Weak = nullptr;
    MarkIf(static_cast<Object*>(&L));
    for (Table* metatable : m_TypeMetatables) MarkIf(metatable);
    TraverseAll();
    m_Gray = m_GrayAgain;
    m_GrayAgain = nullptr;
    TraverseAll();
    size_t dying = SeparateUserdata(false);
    if (m_ToFinalize) {
        Object* object = m_ToFinalize;
        do {
            object = object->m_Next;
            MakeWhite(object);
            MarkObject(object);
        } while (object != m_ToFinalize);
    }
    dying += TraverseAll();
    ClearWeakTables();
    m_White ^= kWhites;
    m_SweepChain = 0;
    m_SweepPlace = &m_Objects;
    m_Phase = Phase::SweepStrings;
    m_Estimate = m_Heap.GetUsed() - dying;
}

// ---- Sweeping

void Machine::FreeObject(Object* object) {
    switch (object->m_Type) {
        case Type::Table:
            return FreeTable(*this, static_cast<Table*>(object));
        case Type::Function:
            return FreeClosure(*this, static_cast<Closure*>(object));
        case Type::Userdata:
            return FreeBytes(object, sizeof(Userdata) + static_cast<Userdata*>(object)->m_Size);
        case Type::Thread:
            return FreeThread(*this, static_cast<State*>(object));
        case Type::Prototype:
            return FreePrototype(*this, static_cast<Prototype*>(object));
        default:
            return FreeUpValue(*this, static_cast<UpValue*>(object));
    }
}

Object** Machine::SweepSome(Object** link, int count) {
    for (; *link && count > 0; count--) {
        Object* object = *link;
        if (IsDead(object)) {
            *link = object->m_Next;
            FreeObject(object);
        } else {
            MakeWhite(object);
            link = &object->m_Next;
        }
    }
    return link;
}

// Calls the finaliser of the first userdata that waits, which may live again by it.
void Machine::RunFinalizer(State& L) {
    Object* object = m_ToFinalize->m_Next;
    if (object == m_ToFinalize) {
        m_ToFinalize = nullptr;
    } else {
        m_ToFinalize->m_Next = object->m_Next;
    }
    object->m_Next = m_Userdata;
    m_Userdata = object;
    MakeWhite(object);
    const Value* method = GetFastMeta(static_cast<Userdata*>(object)->m_Metatable, Event::Gc);
    if (!method) return;
    size_t threshold = m_Threshold;
    m_Threshold = 2 * m_Heap.GetUsed();  // no steps within
    L.Push(*method);
    L.Push(Value::Of(object));
    L.NeedStack(0);
    L.CallAt(L.m_Top - 2, 0);
    m_Threshold = threshold;
}

// ---- Steps

size_t Machine::SingleStep(State& L) {
    switch (m_Phase) {
        case Phase::Pause:
            StartCycle();
            return 0;
        case Phase::Mark:
            if (m_Gray) return TraverseOne();
            FinishMarking(L);
            return 0;
        case Phase::SweepStrings: {
            size_t before = m_Heap.GetUsed();
            size_t end = std::min(m_SweepChain + kSweepCount, m_Strings.GetChainCount());
            for (; m_SweepChain < end; m_SweepChain++) m_Strings.Sweep(*this, m_SweepChain);
            if (m_SweepChain == m_Strings.GetChainCount()) m_Phase = Phase::Sweep;
            m_Estimate -= std::min(m_Estimate, before - m_Heap.GetUsed());
            return kSweepCount * kSweepCost;
        }
        case Phase::Sweep:
        case Phase::SweepUserdata: {
            size_t before = m_Heap.GetUsed();
            m_SweepPlace = SweepSome(m_SweepPlace, kSweepCount);
            m_Estimate -= std::min(m_Estimate, before - m_Heap.GetUsed());
            if (*m_SweepPlace) return kSweepCount * kSweepCost;
            if (m_Phase == Phase::Sweep) {
                m_SweepPlace = &m_Userdata;
                m_Phase = Phase::SweepUserdata;
            } else {
                m_Strings.ShrinkIfEmpty(*this);
                FreeArray(std::exchange(m_Scratch, nullptr), std::exchange(m_ScratchSize, 0));
                m_Phase = Phase::Finalize;
            }
            return kSweepCount * kSweepCost;
        }
        default:
            if (m_ToFinalize) {
                RunFinalizer(L);
                m_Estimate -= std::min(m_Estimate, kFinalizerCost);
                return kFinalizerCost;
            }
            m_Phase = Phase::Pause;
            m_Debt = 0;
            return 0;
    }
}

void Machine::SetThreshold() {
    m_Threshold = m_Estimate / 100 * static_cast<size_t>(std::max(m_Pause, 0));
}

void Machine::StepGc(State& L) {
    if (m_Pauses) return;
    size_t limit = kStepSize / 100 * static_cast<size_t>(std::max(m_StepFactor, 0));
    if (limit == 0) limit = SIZE_MAX / 2;
    m_Debt += m_Heap.GetUsed() - std::min(m_Threshold, m_Heap.GetUsed());
    size_t done = 0;
    while (done < limit) {
        done += SingleStep(L);
        if (m_Phase == Phase::Pause) break;
    }
    if (m_Phase == Phase::Pause) {
        SetThreshold();
    } else if (m_Debt < kStepSize) {
        m_Threshold = m_Heap.GetUsed() + kStepSize;
    } else {
        m_Debt -= kStepSize;
        m_Threshold = m_Heap.GetUsed();
    }
    L.Charge(done / 1024);  // a program sets how often a collection begins
}

bool Machine::StepGcBy(State& L, int kilobytes) {
    size_t size = static_cast<size_t>(kilobytes) << 10;
    size_t used = m_Heap.GetUsed();
    L.Charge(64);
    m_Threshold = size <= used ? used - size : 0;
    while (!m_Pauses && m_Threshold <= m_Heap.GetUsed()) {
        StepGc(L);
        if (m_Phase == Phase::Pause) return true;
    }
    return false;
}

void Machine::CollectAll(State& L) {
    if (m_Pauses) return;
    L.Charge(m_Heap.GetUsed() / 64);
    if (m_Phase <= Phase::Mark) {  // forget the marks: sweep, and find nothing
        m_SweepChain = 0;
        m_SweepPlace = &m_Objects;
        m_Gray = m_GrayAgain = m_Weak = nullptr;
        m_Phase = Phase::SweepStrings;
    }
    while (m_Phase != Phase::Finalize) SingleStep(L);
    StartCycle();
    while (m_Phase != Phase::Pause) SingleStep(L);
    SetThreshold();
}

void Machine::RunWaitingFinalizers(State& L) {
    while (m_ToFinalize) RunFinalizer(L);
}

}  // namespace Korvel::TextForm

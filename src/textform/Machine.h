// What all threads of one interpreter share: memory, strings, the collector, limits.
#pragma once

#include "textform/Heap.h"
#include "textform/Random.h"
#include "textform/StringTable.h"
#include "textform/Table.h"
#include "textform/Value.h"

namespace Korvel::TextForm {

// Operations with metamethods, in the order in which Table::m_Absent has bits for the first ones.
enum class Event : uint8_t {
    Index,
    NewIndex,
    Gc,
    Mode,
    Eq,  // the last with a bit
    Add,
    Sub,
    Mul,
    Div,
    Mod,
    Pow,
    Unm,
    Len,
    Lt,
    Le,
    Concat,
    Call,
    Iter,  // only a name
    Count,
};

enum class Status : uint8_t {
    Ok,
    Yield,
    RunError,
    SyntaxError,
    MemoryError,
    HandlerError,  // an error while an error was handled
    LimitError,    // the work is used up; nothing in a program catches it
};

// What an error is thrown as; its value stands on the thread that raised it.
struct Raised {
    Status m_Status;
};

// Ownership: owns everything, down to the main thread.
// Threads:   one at a time.
class Machine {
public:
    // Throws Raised when memory runs out.
    Machine() = default;
    Machine(const Machine&) = delete;
    Machine& operator=(const Machine&) = delete;

    // Memory. Raises a memory error when there is none.
    void* NewBytes(size_t size) {
        void* p = m_Heap.Allocate(size);
        if (!p) RaiseMemoryError();
        return p;
    }
    void FreeBytes(void* p, size_t size) { m_Heap.Free(p, size); }
    template <class T>
    T* NewArray(size_t count) {
        return static_cast<T*>(NewBytes(count * sizeof(T)));
    }
    template <class T>
    void FreeArray(T* p, size_t count) {
        if (p) m_Heap.Free(p, count * sizeof(T));
    }
    template <class T>
    T* ResizeArray(T* p, size_t oldCount, size_t newCount) {
        if (newCount == 0) {
            FreeArray(p, oldCount);
            return nullptr;
        }
        void* moved = m_Heap.Reallocate(p, oldCount * sizeof(T), newCount * sizeof(T));
        if (!moved) RaiseMemoryError();
        return static_cast<T*>(moved);
    }
    // Doubles an array until it holds `needed` items.
    template <class T>
    void Grow(T*& array, int& capacity, int needed) {
        if (needed <= capacity) return;
        int wanted = capacity > INT32_MAX / 2 ? INT32_MAX : capacity * 2;
        if (wanted < needed) wanted = needed < 4 ? 4 : needed;
        array = ResizeArray(array, capacity, wanted);
        capacity = wanted;
    }
    [[noreturn]] void RaiseMemoryError();

    // A new object, white and on the list of all.
    template <class T>
    T* NewObject(Type type, size_t size = sizeof(T)) {
        auto* object = static_cast<T*>(NewBytes(size));
        object->m_Type = type;
        object->m_Marks = m_White;
        object->m_Next = m_Objects;
        m_Objects = object;
        return object;
    }

    String* NewString(const char* bytes, size_t length);
    String* NewString(std::string_view text) { return NewString(text.data(), text.size()); }

    // The collector (Collector.cpp). A collection is due when the heap has reached m_Threshold.
    static constexpr uint8_t kWhite0 = 1;
    static constexpr uint8_t kWhite1 = 2;
    static constexpr uint8_t kWhites = kWhite0 | kWhite1;
    static constexpr uint8_t kBlack = 4;
    static constexpr uint8_t kFixed = 8;  // never collected
    static constexpr uint8_t kFinalized = 16;
    static constexpr uint8_t kWeakKeys = 32;
    static constexpr uint8_t kWeakValues = 64;

    static bool IsWhite(const Object* o) { return (o->m_Marks & kWhites) != 0; }
    static bool IsBlack(const Object* o) { return (o->m_Marks & kBlack) != 0; }
    bool IsDead(const Object* o) const {
        return (o->m_Marks & (m_White ^ kWhites) & kWhites) && !(o->m_Marks & kFixed);
    }
    void Revive(Object* o) {
        if (IsDead(o)) o->m_Marks ^= kWhites;
    }

    // To be called when `owner` has been made to refer to `value`: the first marks the value, the
    // second has the owner looked at once more, which suits what is written to often.
    void Barrier(Object* owner, const Value& value) {
        if (value.IsObject() && IsBlack(owner) && IsWhite(value.m_Object)) {
            BarrierObject(owner, value.m_Object);
        }
    }
    void Barrier(Object* owner, Object* value) {
        if (value && IsBlack(owner) && IsWhite(value)) BarrierObject(owner, value);
    }
    void BarrierBack(Table* table, const Value& value);

    void CheckGc(State& L) {
        if (m_Heap.GetUsed() >= m_Threshold) StepGc(L);
    }
    void StepGc(State& L);
    void CollectAll(State& L);
    // One step of the size that a program asks for, in KiB. True when it ended a collection.
    bool StepGcBy(State& L, int kilobytes);
    void StopGc() { m_Threshold = SIZE_MAX; }
    void RestartGc() { m_Threshold = m_Heap.GetUsed(); }
    // At the end of a machine: all userdata that have a finaliser wait for its call.
    void ReleaseUserdata() { SeparateUserdata(true); }
    void RunWaitingFinalizers(State& L);
    // To be called when an up-value takes its value along.
    void BarrierClosed(UpValue* upValue);

    // Stops the collector while somebody holds what it does not know.
    class GcPause {
    public:
        explicit GcPause(Machine& machine) : m_Machine(machine) { m_Machine.m_Pauses++; }
        GcPause(const GcPause&) = delete;
        GcPause& operator=(const GcPause&) = delete;
        ~GcPause() { m_Machine.m_Pauses--; }

    private:
        Machine& m_Machine;
    };

    String* GetEventName(Event event) const { return m_EventNames[static_cast<int>(event)]; }
    // The metamethod for one of the first events, looked up once and its absence remembered.
    const Value* GetFastMeta(Table* metatable, Event event) {
        if (!metatable || (metatable->m_Absent >> static_cast<int>(event) & 1)) return nullptr;
        return FindFastMeta(metatable, event);
    }
    // The metamethod of any value; nil when it has none.
    const Value* GetMeta(const Value& value, Event event) const;
    Table* GetMetatable(const Value& value) const;

    Heap m_Heap;
    StringTable m_Strings;
    State* m_MainThread = nullptr;
    Table* m_Registry = nullptr;
    Table* m_TypeMetatables[9] = {};  // by type, for those without one of their own
    String* m_EventNames[static_cast<int>(Event::Count)] = {};
    Random m_Random;

    // Of a limited machine: the instructions that are left. A limit that was hit stays hit.
    int64_t m_Budget = 0;
    bool m_IsLimited = false;
    Status m_Exceeded = Status::Ok;
    [[noreturn]] void RaiseLimit();
    void Spend(size_t work) {
        m_Budget -= static_cast<int64_t>(work);
        if (m_Budget < 0) RaiseLimit();
    }

    // The values of errors that can't be made any more when they are needed.
    String* m_MemoryMessage = nullptr;
    String* m_HandlerMessage = nullptr;
    String* m_LimitMessage = nullptr;

    // Where text is put together; it keeps its size.
    char* NeedScratch(size_t size);
    char* m_Scratch = nullptr;
    size_t m_ScratchSize = 0;

    // Collector
    Object* m_Objects = nullptr;
    Object* m_Userdata = nullptr;    // a list of its own: userdata with finalisers leave it
    Object* m_ToFinalize = nullptr;  // last of a ring, in the order of calls
    State* m_Threads = nullptr;
    size_t m_Threshold = SIZE_MAX;
    int m_Pause = 200;
    int m_StepFactor = 200;
    uint8_t m_White = kWhite0;

private:
    enum class Phase : uint8_t { Pause, Mark, SweepStrings, Sweep, SweepUserdata, Finalize };

    const Value* FindFastMeta(Table* metatable, Event event);
    void BarrierObject(Object* owner, Object* value);

    void MarkObject(Object* object);
    void Mark(const Value& value) {
        if (value.IsObject() && IsWhite(value.m_Object)) MarkObject(value.m_Object);
    }
    template <class T>
    void MarkIf(T* object) {
        if (object && IsWhite(object)) MarkObject(object);
    }
    void MakeWhite(Object* o) {
        o->m_Marks = static_cast<uint8_t>((o->m_Marks & ~(kWhites | kBlack)) | m_White);
    }
    void LinkGray(Object* object, Object*& list);
    void StartCycle();
    size_t TraverseOne();
    size_t TraverseAll();
    size_t Traverse(Table* table);
    size_t Traverse(Closure* closure);
    size_t Traverse(Prototype* prototype);
    size_t Traverse(State* thread);
    void RemarkUpValues();
    size_t SeparateUserdata(bool all);
    void ClearWeakTables();
    void FinishMarking(State& L);
    size_t SingleStep(State& L);
    Object** SweepSome(Object** place, int count);
    void FreeObject(Object* object);
    void SetThreshold();
    void RunFinalizer(State& L);

    Phase m_Phase = Phase::Pause;
    int m_Pauses = 0;
    size_t m_SweepChain = 0;
    Object** m_SweepPlace = nullptr;
    Object* m_Gray = nullptr;
    Object* m_GrayAgain = nullptr;
    Object* m_Weak = nullptr;
    size_t m_Estimate = 0;
    size_t m_Debt = 0;

    friend class StringTable;
};

}  // namespace Korvel::TextForm

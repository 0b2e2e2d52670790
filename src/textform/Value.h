// The values of the interpreter and the objects that its collector owns.
//
// A value is a tag and a payload in 16 bytes. Nil, booleans, numbers and light userdata live in the
// value itself; all others point to an Object, which stands on the list of its machine until the
// collector sweeps it.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string_view>

namespace Korvel::TextForm {

class Machine;
class State;

enum class Type : int32_t {
    None = -1,  // what stands for an argument that was not passed
    Nil,
    Boolean,
    LightUserdata,
    Number,
    String,
    Table,
    Function,
    Userdata,
    Thread,
    // never seen by programs
    Prototype,
    UpValue,
    DeadKey,  // of a table's node, when the collector has taken what the key was
};

// The name that messages and type() give, for None to Thread.
const char* GetTypeName(Type type);

// The head of all that is collected.
struct Object {
    Object* m_Next;
    Type m_Type;
    uint8_t m_Marks;   // bits of Collector
    uint8_t m_Extra;   // String: a reserved word's number; Closure: whether native
    uint8_t m_Absent;  // Table: metamethods known to be absent, a bit each
    uint8_t m_Log;     // Table: binary logarithm of the number of nodes
};
static_assert(sizeof(Object) == 16);

struct String;
struct Table;
struct Closure;
struct Userdata;

struct Value {
    union {
        Object* m_Object;
        void* m_Pointer;
        double m_Number;
        uint64_t m_Boolean;
    };
    Type m_Type;

    Value() = default;
    constexpr Value(Type type, Object* object) : m_Object(object), m_Type(type) {}
    constexpr Value(const Value&) = default;
    // Part by part: a load of all 16 bytes would wait for the stores of the parts before it.
    Value& operator=(const Value& other) {
        m_Object = other.m_Object;
        m_Type = other.m_Type;
        return *this;
    }

    static Value Nil() { return {Type::Nil, nullptr}; }
    static Value Number(double number) {
        Value value;
        value.m_Number = number;
        value.m_Type = Type::Number;
        return value;
    }
    static Value Boolean(bool boolean) {
        Value value;
        value.m_Boolean = boolean;
        value.m_Type = Type::Boolean;
        return value;
    }
    static Value LightUserdata(void* p) {
        Value value;
        value.m_Pointer = p;
        value.m_Type = Type::LightUserdata;
        return value;
    }
    static Value Of(Object* object) { return {object->m_Type, object}; }
    template <class T>
    static Value Of(T* object) {
        return Of(reinterpret_cast<Object*>(object));
    }

    bool Is(Type type) const { return m_Type == type; }
    bool IsNil() const { return m_Type == Type::Nil; }
    bool IsNumber() const { return m_Type == Type::Number; }
    bool IsString() const { return m_Type == Type::String; }
    bool IsTable() const { return m_Type == Type::Table; }
    bool IsFunction() const { return m_Type == Type::Function; }
    bool IsFalse() const { return IsNil() || (m_Type == Type::Boolean && !m_Boolean); }
    bool IsObject() const { return m_Type >= Type::String; }

    String* AsString() const { return reinterpret_cast<String*>(m_Object); }
    Table* AsTable() const { return reinterpret_cast<Table*>(m_Object); }
    Closure* AsFunction() const { return reinterpret_cast<Closure*>(m_Object); }
    Userdata* AsUserdata() const { return reinterpret_cast<Userdata*>(m_Object); }
};
static_assert(sizeof(Value) == 16);

// Equality without metamethods.
inline bool RawEquals(const Value& a, const Value& b) {
    if (a.m_Type != b.m_Type) return false;
    if (a.IsNumber()) return a.m_Number == b.m_Number;
    return a.IsNil() || a.m_Object == b.m_Object;
}

// The conversions of numbers, with the results that the processor gives where C++ defines none.
inline int64_t ToInt64(double number) {
    return number >= -9223372036854775808.0 && number < 9223372036854775808.0
               ? static_cast<int64_t>(number)
               : INT64_MIN;
}
inline int32_t ToInt32(double number) {
    return number > -2147483649.0 && number < 2147483648.0 ? static_cast<int32_t>(number)
                                                           : INT32_MIN;
}

// Each string exists once in a machine, so that equal strings have equal addresses. The bytes stand
// behind the record, with a zero behind them.
struct String : Object {
    uint32_t m_Hash;
    size_t m_Length;

    char* GetBytes() { return reinterpret_cast<char*>(this + 1); }
    const char* GetText() const { return reinterpret_cast<const char*>(this + 1); }
    std::string_view GetView() const { return {GetText(), m_Length}; }
};

struct Userdata : Object {
    Table* m_Metatable;
    Table* m_Environment;
    size_t m_Size;

    void* GetData() { return this + 1; }
};

using Instruction = uint32_t;

struct LocalVariable {
    String* m_Name;
    int m_StartPc;  // the first instruction where it is alive
    int m_EndPc;    // the first where it is dead
};

// What the compiler makes of a function's text. The arrays belong to the record.
struct Prototype : Object {
    static constexpr uint8_t kHasArg = 1;    // has the hidden parameter "arg"
    static constexpr uint8_t kIsVararg = 2;  // declared with "..."
    static constexpr uint8_t kNeedsArg = 4;  // "arg" is to be filled: "..." is not used

    Value* m_Constants;
    Instruction* m_Code;
    Prototype** m_Prototypes;
    int* m_Lines;  // of each instruction
    LocalVariable* m_Locals;
    String** m_UpValueNames;
    String* m_Source;
    int m_ConstantCount;
    int m_CodeCount;
    int m_PrototypeCount;
    int m_LineCount;
    int m_LocalCount;
    int m_UpValueNameCount;
    int m_LineDefined;
    int m_LastLineDefined;
    Object* m_GcList;
    uint8_t m_UpValueCount;
    uint8_t m_ParameterCount;
    uint8_t m_VarargFlags;
    uint8_t m_MaxStackSize;
};

// A variable that closures share: while open, a slot of a stack; then a value of its own.
struct UpValue : Object {
    Value* m_Place;
    Value m_Closed;
    UpValue* m_NextOpen;  // of the same thread, in falling order of slots
    UpValue** m_Link;     // what points here on that list; null once closed
};

// Returns how many values on the top of the stack are its results.
using NativeFunction = int (*)(State& L);

// A function with its environment and up-values; m_Extra tells which kind.
struct Closure : Object {
    Table* m_Environment;
    Object* m_GcList;
    int m_UpValueCount;

    bool IsNative() const { return m_Extra != 0; }
};

struct ScriptClosure : Closure {
    Prototype* m_Prototype;

    UpValue** GetUpValues() { return reinterpret_cast<UpValue**>(this + 1); }
};

struct NativeClosure : Closure {
    NativeFunction m_Function;

    Value* GetUpValues() { return reinterpret_cast<Value*>(this + 1); }
};

inline ScriptClosure* AsScript(Closure* c) {
    return static_cast<ScriptClosure*>(c);
}
inline NativeClosure* AsNative(Closure* c) {
    return static_cast<NativeClosure*>(c);
}

}  // namespace Korvel::TextForm

#pragma once

#include <cstdint>

#include "core/Export.h"
#include "core/ScriptVal.h"

struct lua_State;

// How a native class becomes a type in Lua: a userdata with member functions (`object:Func(x)`),
// member variables (`object.Var`), operators, and a constructor `class.<name>`. A type is described
// once, by a static object of a class derived from LuaTypeT; all interpreters share it, and each of
// them gets its metatable when the type is registered there.
//
//     class LuaType_Deck : public LuaTypeT<Deck> {
//     public:
//         using LuaTypeT::LuaTypeT;
//         int lw_create(lua_State* L) override { return lw_push(L, new Deck); }
//         int lw_recycle(lua_State*, void* deck, LuaType*) override {
//             delete Self(deck);
//             return 0;
//         }
//
//         int lwf_Play(lua_State* L, Deck* deck, LuaType*) { ... }
//         int lwm_Speed(lua_State* L, Deck* deck, LuaType*, bool set) { ... }
//         static LuaFuncTable s_Functions[];
//         static LuaMemberTable s_Members[];
//     };
//     LuaFuncTable LuaType_Deck::s_Functions[] = {Func<&LuaType_Deck::lwf_Play>("Play"), {}};
//     LuaMemberTable LuaType_Deck::s_Members[] = {Member<&LuaType_Deck::lwm_Speed>("Speed"), {}};
//     LuaType_Deck s_LuaType_Deck("Deck", &LuaClass::s_LuaType, LuaType_Deck::s_Functions,
//                                 LuaType_Deck::s_Members);
//
// Threads: type objects are built while a library loads and are not changed after that. All that
//          takes a lua_State is for the thread that runs it.
// Errors:  what takes a lua_State may raise Lua errors, at least when memory runs out.
namespace Korvel {

class LuaType;
class _LuaType;

// The hash under which a type looks names up; 0 for null and for an empty text.
KORVEL_EXPORT uint32_t gethash(const char* text);

// A member function of a Lua type. The table of a type ends with an entry without a name.
//   owner  the type in whose table the entry stands
//   type   the type of the object
struct LuaFuncTable {
    const char* m_Name = nullptr;
    int (*m_Function)(LuaType* owner, lua_State* L, void* object, LuaType* type) = nullptr;
    uint32_t m_Hash = 0;  // filled in by the type's constructor
};

// A member variable: the handler reads it, with the name as argument 1, or with `set` writes it
// from argument 1. One table type serves all classes, so entries hold thunks of member functions,
// see LuaTypeT.
struct LuaMemberTable {
    const char* m_Name = nullptr;
    int (*m_Function)(LuaType* owner, lua_State* L, void* object, LuaType* type,
                      bool set) = nullptr;
    uint32_t m_Hash = 0;
};

// All types, the newest first; see _LuaType::GetNext.
KORVEL_EXPORT extern _LuaType* g_LuaTypeList;

// The description of a type: its name, its parent and its tables. Always the base of a LuaType.
//
// Look-up: a name is sought in the member table and then the function table of the object's type,
//          then in those of its parent, and so on; lw_index and lw_newindex get what is not found.
// Life:    type objects outlive all interpreters that they are used in.
class KORVEL_EXPORT _LuaType {
public:
    // All is borrowed for the life of the type. The tables, which null leaves out, get their hashes
    // here. The last two parameters are kept and not read.
    _LuaType(const char* name, LuaType* parent, LuaFuncTable* functions, LuaMemberTable* members,
             uint32_t data1 = 0, uint32_t data2 = 0);
    _LuaType(const _LuaType&) = delete;
    _LuaType& operator=(const _LuaType&) = delete;
    virtual ~_LuaType() = 0;

    // Makes the metatable in an interpreter, and the constructor function under the type's name in
    // the global table `class`, which is made when there is none. Parents need no registration.
    // Doing it again replaces both; objects that are there keep what they have.
    void lw_register(lua_State* L);
    void lw_register(lua_State* L, int index);  // the same with the table at `index` for `class`

    // Pushes an object, nil for null, and returns 1. See lua_pushLuaObject, which it calls with
    // what lw_from_type makes of `object`.
    int lw_push(lua_State* L, void* object) { return lw_push(L, object, 0); }
    int lw_push(lua_State* L, void* object, unsigned int flags);

    // The type of that name among this one and its parents; null if there is none.
    LuaType* FindType(const char* name);

    _LuaType* GetNext() const { return m_Next; }
    LuaType* GetParent() const { return m_Parent; }
    const char* GetName() const { return m_Name; }
    LuaFuncTable* GetFunctions() const { return m_Functions; }
    LuaMemberTable* GetMembers() const { return m_Members; }
    ScriptVal& GetValues() const { return *m_Values; }  // a table for the type's own use

private:
    _LuaType* m_Next;
    LuaType* m_Parent;   // null at the root
    const char* m_Name;  // not null
    [[maybe_unused]] uint32_t m_Data1;
    [[maybe_unused]] uint32_t m_Data2;
    LuaFuncTable* m_Functions;  // not null
    LuaMemberTable* m_Members;  // not null
    ScriptVal* m_Values;        // owned
};

// What a type does with its objects. Each operation returns its number of Lua results.
//
//   object     as lw_to_type of this type gives it
//   type       the type of the object: this type or one derived from it
//   arguments  begin at index 1, without the object. Behind them stands the object's userdata,
//              which keeps the object alive while the operation runs, so the stack is not to be
//              cut below it. lw_istypeof finds its argument on top, whatever is below.
//
// An operation may raise Lua errors, holding nothing with a destructor then, or throw a
// std::exception, which becomes a Lua error. A script may let go of any object at any time, by
// calling its `__gc`: an operation that runs scripts and needs the object afterwards takes a
// reference of its own.
class KORVEL_EXPORT LuaType : public _LuaType {
public:
    using _LuaType::_LuaType;

    // The order of the virtual operations is a contract.

    // The function `class.<name>`, with the script's arguments.
    virtual int lw_create(lua_State* L) = 0;

    virtual int lw_typename(lua_State* L, void* object, LuaType* type) = 0;  // pushes the name
    // Pushes true when the type name on top of the stack is one of the object's.
    virtual int lw_istypeof(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_tostring(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_call(lua_State* L, void* object, LuaType* type) = 0;  // the object is argument 1
    virtual int lw_newindex(lua_State* L, void* object, LuaType* type) = 0;  // key 1, value 2
    virtual int lw_index(lua_State* L, void* object, LuaType* type) = 0;     // key 1

    // The object is the left operand, argument 1 the right one. With any other value on the left,
    // no operation is called and the result is nil.
    virtual int lw_add(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_sub(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_mul(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_div(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_pow(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_unm(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_eq(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_lt(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_le(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_concat(lua_State* L, void* object, LuaType* type) = 0;

    // A userdata takes a reference to its object, and gives it back. lw_recycle may run whenever
    // Lua collects garbage, so it must not fail, and has no arguments.
    virtual int lw_use(lua_State* L, void* object, LuaType* type) = 0;
    virtual int lw_recycle(lua_State* L, void* object, LuaType* type) = 0;

    // For the host's own use; nothing here calls them.
    virtual int lw_do(lua_State* L, void* object, LuaType* type, int what, void* data) = 0;
    virtual int lw_do(lua_State* L, void* object, LuaType* type, const char* what, void* data) = 0;

    // From the pointer that a userdata holds to the one that this type works on, and back. They
    // throw nothing.
    virtual void* lw_to_type(void* object) = 0;
    virtual void* lw_from_type(void* object) = 0;
};

// The base of types for objects of class T. Without an override an operation is the parent's, and
// has no results at the root.
template <class T>
class LuaTypeT : public LuaType {
public:
    using LuaType::LuaType;

    static T* Self(void* object) { return static_cast<T*>(object); }

    // Table entries for handlers of the forms
    //   int Handler(lua_State*, T* object, LuaType* type)
    //   int Handler(lua_State*, T* object, LuaType* type, bool set)
    template <auto handler>
    static constexpr LuaFuncTable Func(const char* name) {
        return {name, [](LuaType* owner, lua_State* L, void* object, LuaType* type) {
                    return (OwnerOf(handler, owner)->*handler)(L, Self(object), type);
                }};
    }
    template <auto handler>
    static constexpr LuaMemberTable Member(const char* name) {
        return {name, [](LuaType* owner, lua_State* L, void* object, LuaType* type, bool set) {
                    return (OwnerOf(handler, owner)->*handler)(L, Self(object), type, set);
                }};
    }

    int lw_typename(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_typename>(L, object, type);
    }
    int lw_istypeof(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_istypeof>(L, object, type);
    }
    int lw_tostring(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_tostring>(L, object, type);
    }
    int lw_call(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_call>(L, object, type);
    }
    int lw_newindex(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_newindex>(L, object, type);
    }
    int lw_index(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_index>(L, object, type);
    }
    int lw_add(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_add>(L, object, type);
    }
    int lw_sub(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_sub>(L, object, type);
    }
    int lw_mul(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_mul>(L, object, type);
    }
    int lw_div(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_div>(L, object, type);
    }
    int lw_pow(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_pow>(L, object, type);
    }
    int lw_unm(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_unm>(L, object, type);
    }
    int lw_eq(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_eq>(L, object, type);
    }
    int lw_lt(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_lt>(L, object, type);
    }
    int lw_le(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_le>(L, object, type);
    }
    int lw_concat(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_concat>(L, object, type);
    }
    int lw_use(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_use>(L, object, type);
    }
    int lw_recycle(lua_State* L, void* object, LuaType* type) override {
        return Parents<&LuaType::lw_recycle>(L, object, type);
    }
    int lw_do(lua_State* L, void* object, LuaType* type, int what, void* data) override {
        LuaType* parent = GetParent();
        return parent ? parent->lw_do(L, AsParents(object), type, what, data) : 0;
    }
    int lw_do(lua_State* L, void* object, LuaType* type, const char* what, void* data) override {
        LuaType* parent = GetParent();
        return parent ? parent->lw_do(L, AsParents(object), type, what, data) : 0;
    }
    void* lw_to_type(void* object) override { return object; }
    void* lw_from_type(void* object) override { return object; }

private:
    template <class Owner, class... Arguments>
    static Owner* OwnerOf(int (Owner::*)(Arguments...), LuaType* owner) {
        return static_cast<Owner*>(owner);
    }

    void* AsParents(void* object) { return GetParent()->lw_to_type(lw_from_type(object)); }

    template <int (LuaType::*operation)(lua_State*, void*, LuaType*)>
    int Parents(lua_State* L, void* object, LuaType* type) {
        LuaType* parent = GetParent();
        return parent ? (parent->*operation)(L, AsParents(object), type) : 0;
    }
};

// Flags of lua_pushLuaObject.
constexpr unsigned int LWF_NoReference = 0x1;  // the userdata holds no reference to the object

// Pushes the userdata of an object: the one that this interpreter has, or a new one, which takes a
// reference through lw_use. `flags` are for a new one. Pushes nil without an object or a type. Of
// two objects at one address, which are of unrelated types, the one that was pushed last has it.
KORVEL_EXPORT void lua_pushLuaObject(lua_State* L, void* object, LuaType* type,
                                     unsigned int flags = 0);

// Pushes the userdata of a bare pointer, which it holds, the one that this interpreter has or a new
// one; nil for null. A new one, and only that, gets the metatable that the registry holds under
// `typeName`, unless that is null. The name of a LuaType raises an error: its userdata hold
// something else.
KORVEL_EXPORT void lua_pushobject(lua_State* L, void* object, const char* typeName);

// Whether the value is a userdata of a LuaType that has this name among its own and its parents',
// or whose lw_istypeof says so. False for any other value, whatever its metatable says: a script
// must not pass off other memory as an object.
KORVEL_EXPORT bool lua_istype(lua_State* L, int index, const char* name);

// The object of such a value, as the type of that name sees it; else null. Lua keeps it alive for
// as long as the value is reachable.
KORVEL_EXPORT void* lua_totype(lua_State* L, int index, const char* name);

// The arguments and the result of safe_istype.
struct IsTypeData {
    bool m_Result;
    int m_Index;
    const char* m_Name;
};
// The body of lua_istype.
KORVEL_EXPORT void safe_istype(lua_State* L, IsTypeData* data);

// Makes a field of a global table a global too; all its fields for a null `field`. What is not
// there changes nothing.
KORVEL_EXPORT void lw_flaunttable(lua_State* L, const char* table, const char* field);

// A relative index made absolute; others stay.
KORVEL_EXPORT int lua_absindex(lua_State* L, int index);

// The value if it has that very type, else the default. Texts are Lua's.
KORVEL_EXPORT double lua_tonumber_def(lua_State* L, int index, double fallback);
KORVEL_EXPORT const char* lua_tostring_def(lua_State* L, int index, const char* fallback);
KORVEL_EXPORT bool lua_toboolean_def(lua_State* L, int index, bool fallback);

// False for nothing, nil and false.
KORVEL_EXPORT bool lua_istrue(lua_State* L, int index);

}  // namespace Korvel

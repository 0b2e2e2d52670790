#pragma once

#include <bit>

#include "objects/ScriptSymbol.h"

// The short way to publish a class. In the class, which derives from Scripted:
//
//     class Counter : public Korvel::Scripted<Korvel::RefObject> {
//         KORVEL_SCRIPTED(Counter)
//     public:
//         Counter() { SetScriptClass(); }
//     private:
//         double m_Value = 0;
//     };
//
// and in one source, in the namespace of the class:
//
//     KORVEL_PUBLISH(Counter, "Counter", "Counts.", "A longer text on what it counts.")
//
//     KORVEL_FUNCTION(Counter, Add, SSF_AnyThread, {SYMT_ShortHelp, "Adds a number."}) {
//         args.ReturnNumber(self.m_Value += args[1].ToNumber());
//     }
//
//     KORVEL_VARIABLE(Counter, Value, SSF_Read | SSF_Write) {
//         if (set) {
//             self.m_Value = args[1].ToNumber();
//         } else {
//             args.ReturnNumber(self.m_Value);
//         }
//     }
//
//     KORVEL_PUBLISHED(Counter);
//
// A member's macro takes the class, the member's name, its SSF_ flags (0 for none) and any number
// of help tags; the body follows. It sees
//
//     Counter& self         the object; private members are within reach
//     ScriptArgs& args      arguments, results and error, see ScriptSymbol::Call
//     ScriptSymbol* symbol  the member itself
//     bool set              true where a variable is written, with args[1]
//
// The body must not throw.
//
// A class that derives from a published one publishes in the same way, but without a Scripted of
// its own; its parent is found by its first object.
//
// What comes of it are the record __ScriptInfo_Counter, and Counter_Scripting, which holds for each
// member a class cl_CounterAdd with the function and the symbol sym_CounterAdd. All of it is made
// by the static initialisers of the source, in the order of the text, and undone in the reverse
// order.

// In the class body; what follows is private. It declares SetScriptClass, which each constructor of
// the class, copying ones too, calls first.
#define KORVEL_SCRIPTED(Class)      \
private:                            \
    friend class Class##_Scripting; \
    void SetScriptClass();

// Opens the publication of a class. The name is the one that scripts see.
#define KORVEL_PUBLISH(Class, Name, ShortHelp, LongHelp)                                    \
    static ::Korvel::ScriptInfoT<Class> __ScriptInfo_##Class{1, Name, ShortHelp, LongHelp}; \
    void Class::SetScriptClass() {                                                          \
        ::Korvel::_SetScriptInfo(this, __ScriptInfo_##Class);                               \
    }                                                                                       \
    class Class##_Scripting {                                                               \
    public:

#define KORVEL_FUNCTION(Class, Member, Flags, ...) \
    KORVEL_MEMBER_(Class, Class, Member, #Member, ::Korvel::SST_Function | (Flags), __VA_ARGS__)

// One body reads and writes; without SSF_Write it is not called to write, without SSF_Read not to
// read.
#define KORVEL_VARIABLE(Class, Member, Flags, ...) \
    KORVEL_MEMBER_(Class, Class, Member, #Member, ::Korvel::SST_Variable | (Flags), __VA_ARGS__)

// Returns the constant. Every object of every class has it, once there has been one of this class:
// so `self` is a ScriptObject of any class.
#define KORVEL_CONSTANT(Class, Member, Flags, ...)                 \
    KORVEL_MEMBER_(Class, ::Korvel::ScriptObject, Member, #Member, \
                   ::Korvel::SST_Constant | (Flags), __VA_ARGS__)

// The opcode's name, such as SST_Call, stands in place of a member's.
#define KORVEL_OPCODE(Class, Opcode, Flags, ...)                                                   \
    static_assert(::Korvel::Opcode != ::Korvel::SST_Create, "KORVEL_CREATE publishes SST_Create"); \
    KORVEL_MEMBER_(Class, Class, Opcode, nullptr, ::Korvel::Opcode | (Flags), __VA_ARGS__)

// SST_Create, which makes an object of the class. Scripts get it from any object by the name of the
// class, and may call it on that: so `self` is a ScriptObject of any class.
#define KORVEL_CREATE(Class, Flags, ...)                               \
    KORVEL_MEMBER_(Class, ::Korvel::ScriptObject, SST_Create, nullptr, \
                   ::Korvel::SST_Create | (Flags), __VA_ARGS__)

// A topic of the help. It has no body.
#define KORVEL_HELP(Class, Topic, ...)                               \
    ::Korvel::ScriptSymbolT<Class> sym_##Class##Topic {              \
        nullptr, #Topic, ::Korvel::SST_Help, __ScriptInfo_##Class, { \
            __VA_ARGS__                                              \
        }                                                            \
    }

// Closes the publication.
#define KORVEL_PUBLISHED(Class) \
    }                           \
    ;                           \
    [[maybe_unused]] static Class##_Scripting s_##Class##_Scripting

#define KORVEL_MEMBER_(Class, Object, Member, Name, Flags, ...)                           \
    class cl_##Class##Member {                                                            \
    public:                                                                               \
        void Func(::Korvel::ScriptArgs& args, ::Korvel::ScriptSymbol* symbol, bool set) { \
            if (!::Korvel::AcceptsCall(Flags, set)) return;                               \
            run_##Class##Member(*reinterpret_cast<Object*>(this), args, symbol, set);     \
        }                                                                                 \
    };                                                                                    \
    ::Korvel::ScriptSymbolT<Object> sym_##Class##Member{                                  \
        ::Korvel::MemberOf<Object>(&cl_##Class##Member::Func),                            \
        Name,                                                                             \
        Flags,                                                                            \
        __ScriptInfo_##Class,                                                             \
        {__VA_ARGS__}};                                                                   \
    static void run_##Class##Member(                                                      \
        [[maybe_unused]] Object& self, [[maybe_unused]] ::Korvel::ScriptArgs& args,       \
        [[maybe_unused]] ::Korvel::ScriptSymbol* symbol, [[maybe_unused]] bool set)

namespace Korvel {

// Keeps the object's record: the base of the first published class of a family. `Base` is a
// ScriptObject; its constructors are there for the derived class.
template <class Base>
class Scripted : public Base {
public:
    using ScriptedClass = Scripted;
    static_assert(
        !requires { typename Base::ScriptedClass; },
        "the base keeps the record already: derive from it directly");

    using Base::Base;
    Scripted() = default;
    // A copy may be of a base class of the original's, so it gets a record from its own
    // constructor.
    Scripted(const Scripted& other) : Base(other) {}
    Scripted& operator=(const Scripted& other) {
        Base::operator=(other);
        return *this;
    }

    ScriptInfo* GetScriptInfo() const override { return m_ScriptInfo; }
    void SetScriptInfo(ScriptInfo* info) override { m_ScriptInfo = info; }

private:
    ScriptInfo* m_ScriptInfo = nullptr;
};

// Whether a published member is called at all: not to write what cannot be written, and not to read
// what cannot be read.
constexpr bool AcceptsCall(uint32_t flags, bool set) {
    switch (flags & SST_KindMask) {
        case SST_Variable:
            return (flags & (set ? SSF_Write : SSF_Read)) != 0;
        case SST_Constant:
            return !set;
        default:
            return true;
    }
}

// A function of one class to be called on an object of another, whose address it takes as its own.
// (A class derived from T could do with a cast, but T may be final, or have other such functions.)
template <class T, class Member>
typename ScriptSymbolT<T>::Function MemberOf(void (Member::*function)(ScriptArgs&, ScriptSymbol*,
                                                                      bool)) {
    return std::bit_cast<typename ScriptSymbolT<T>::Function>(function);
}

}  // namespace Korvel

#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <iterator>
#include <type_traits>

#include "core/0ReusePool.h"
#include "core/Export.h"
#include "core/OxID.h"
#include "core/ScriptVal.h"
#include "objects/ScriptObject.h"

// What a class shows to scripts: one ScriptInfo record for the class, one ScriptSymbol for each
// member, and one way to call any of them, ScriptSymbol::Call. Publish.h has the short way to write
// them down, docs/publishing.md tells the whole of it.
namespace Korvel {

class NestedSpinLock;
class ScriptInfo;
class ScriptSymbol;
class TagList;

// The low byte of a symbol's flags: what it is, or from 128 on the operation that it serves.
enum ScriptSymbolKind : uint32_t {
    SST_Function = 1,
    SST_Variable = 2,  // one function reads and writes it
    SST_Constant = 3,  // once its class has had an object, called on those of any class
    SST_Help = 4,      // a topic of the help, nothing to call

    SST_FirstOpcode = 128,
    SST_Create = SST_FirstOpcode,
    SST_Call,      // the object itself as a function
    SST_GetTable,  // index, to read; key 0 of the args is the name
    SST_SetTable,  // index, to write
    SST_Add,
    SST_Sub,
    SST_Mul,
    SST_Div,
    SST_Pow,
    SST_Unm,
    SST_EQ,
    SST_LE,
    SST_LT,
    SST_Concat,
    SST_ToString,
    SST_CallFunction,        // calls the function at key 0
    SST_CallMemberFunction,  // calls the member with the name at key 0
    SST_GetSetAttrs,
    SST_GetCustomData,
    SST_SetCustomData,
    SST_GetObject,  // the object at an address
    SST_OnConnect,
    SST_OnConnectFailed,
    SST_OnDisconnect,
    SST_IsDebug,
    SST_GetTableUnknown,  // index, for a name that no member has
    SST_EndOpcode,
};

constexpr unsigned int kOpcodeSlots = 128;

// The names of the opcodes, from SST_FirstOpcode on.
KORVEL_EXPORT extern const char* const SSTName[SST_EndOpcode - SST_FirstOpcode];

// The rest of a symbol's flags.
constexpr uint32_t SST_KindMask = 0xff;
constexpr uint32_t SSF_Read = 0x100;          // a variable that can be read
constexpr uint32_t SSF_Write = 0x200;         // a variable that can be written
constexpr uint32_t SSF_AnyThread = 0x100000;  // runs on its caller's thread, UI or not
constexpr uint32_t SSF_Hidden = 0x400000;     // not in the help, but for debug mode
constexpr uint32_t SSF_DelayGet = 0x800000;   // calls and reads are paced, see Call
constexpr uint32_t SSF_DelaySet = 0x1000000;  // writes are paced
constexpr uint32_t SSF_Debug = 0x80000000;    // is there in debug mode only

// Help tags. Their order counts: what describes an argument or a result follows its usage.
constexpr unsigned long long SYMT_ShortHelp = 0x30000000;     // one line
constexpr unsigned long long SYMT_AttrName = 0x30000001;      // a variable's key among attributes
constexpr unsigned long long SYMT_Optional = 0x18000000;      // bool: so are the next arguments
constexpr unsigned long long SYMT_Body = 0x38000000;          // a paragraph
constexpr unsigned long long SYMT_Code = 0x38000001;          // a sample
constexpr unsigned long long SYMT_CodeLanguage = 0x38000002;  // of the next sample
constexpr unsigned long long SYMT_CodeLabel = 0x38000003;     // of the next sample
constexpr unsigned long long SYMT_Usage = 0x38000004;         // opens one way to call the member
constexpr unsigned long long SYMT_ReturnType = 0x38000005;
constexpr unsigned long long SYMT_ReturnName = 0x38000006;
constexpr unsigned long long SYMT_ReturnDesc = 0x38000007;
constexpr unsigned long long SYMT_ArgType = 0x38000008;
constexpr unsigned long long SYMT_ArgName = 0x38000009;
constexpr unsigned long long SYMT_ArgDesc = 0x3800000a;
constexpr unsigned long long SYMT_SeeAlso = 0x3800000b;

// One help tag with its value, for lists written in source code. The text is borrowed.
struct HelpTag {
    constexpr HelpTag(unsigned long long tag, const char* text) : m_Tag(tag), m_Text(text) {}
    constexpr HelpTag(unsigned long long tag, bool value) : m_Tag(tag), m_Bool(value) {}

    unsigned long long m_Tag;
    const char* m_Text = nullptr;
    bool m_Bool = false;
};

// The members on a record's list, the newest first. Made by ScriptInfo::GetSymbols. It may be
// walked on any thread without a lock, also while members are added or constants move to the root.
class SymbolRange {
public:
    class Iterator {
    public:
        using iterator_category = std::forward_iterator_tag;
        using value_type = ScriptSymbol;
        using difference_type = std::ptrdiff_t;
        using pointer = ScriptSymbol*;
        using reference = ScriptSymbol&;

        Iterator() = default;
        Iterator(const ScriptInfo* list, ScriptSymbol* symbol) : m_List(list), m_Symbol(symbol) {}
        ScriptSymbol& operator*() const { return *m_Symbol; }
        ScriptSymbol* operator->() const { return m_Symbol; }
        Iterator& operator++();
        Iterator operator++(int) {
            Iterator before = *this;
            ++*this;
            return before;
        }
        bool operator==(const Iterator& other) const { return m_Symbol == other.m_Symbol; }

    private:
        const ScriptInfo* m_List = nullptr;
        ScriptSymbol* m_Symbol = nullptr;
    };

    explicit SymbolRange(const ScriptInfo& list) : m_List(list) {}
    Iterator begin() const;
    Iterator end() const { return {}; }

private:
    const ScriptInfo& m_List;
};

// The record of one class.
//
// Life:    a class's record is static, or made at run time and then alive as long as an object or a
//          symbol of the class. It enters the list of all records where it is constructed and
//          leaves it where it is destroyed; its symbols go first.
// Parent:  unknown until the class's first object is constructed (_SetScriptInfo), or until
//          _InitScriptInfo names it; then final. Up to then look-ups see the class's own members
//          alone. As it becomes known, the class's constants move to the root's list.
// Threads: look-ups take no lock and may run while symbols are added and parents found. Nobody may
//          look up or call what is being destroyed: a symbol made at run time is deleted when no
//          call to its class can be under way.
class KORVEL_EXPORT ScriptInfo : public Reuser {
public:
    // The texts are borrowed; null ones count as empty.
    ScriptInfo(unsigned int version, const char* name, const char* shortHelp, const char* longHelp);
    ScriptInfo(const ScriptInfo&) = delete;
    ScriptInfo& operator=(const ScriptInfo&) = delete;
    virtual ~ScriptInfo();

    // From a ScriptObject* to the class's own pointer, and back.
    virtual void* _FromObj(void* object) = 0;
    virtual void* _ToObj(void* object) = 0;

    // The member that a name, or for `kind` from 128 on an opcode, means on an object of this
    // class; null when there is none. A subclass goes before its parents, a
    // newer symbol before an older one. Members for debug mode are passed over outside of it.
    //   name  compared by bytes; with null a symbol without a name
    //   kind  the SST_ kind or opcode, modulo 256; 0 is any kind below 128
    ScriptSymbol* FindSymbol(const char* name, unsigned int kind) const;

    uint32_t GetVersion() const { return m_Version; }
    const char* GetName() const { return m_Name; }
    const char* GetShortHelp() const { return m_ShortHelp; }
    const char* GetLongHelp() const { return m_LongHelp; }

    // The base class's record; null for the root, and as long as it is unknown.
    ScriptInfo* GetParent() const {
        ScriptInfo* parent = m_Parent.load(std::memory_order_acquire);
        return parent == Unknown() ? nullptr : parent;
    }
    bool IsParentKnown() const { return m_Parent.load(std::memory_order_acquire) != Unknown(); }

    // The host's to use; nil at first. Not guarded.
    ScriptVal& GetData() { return m_Data; }

    // The next record on g_ScriptInfoList.
    ScriptInfo* GetNext() const { return m_Next.load(std::memory_order_acquire); }

    // The class's members without opcodes; of the root also all constants of known classes.
    SymbolRange GetSymbols() const { return SymbolRange(*this); }

    // The class's own symbol for an opcode, or null.
    ScriptSymbol* GetOpcode(unsigned int opcode) const {
        return m_Opcodes[opcode % kOpcodeSlots].load(std::memory_order_acquire);
    }

protected:
    void BecomeRoot() { m_Parent = nullptr; }  // for the root's constructor

private:
    friend class ScriptSymbol;
    friend class SymbolRange;
    friend struct ScriptInfoAccess;

    static ScriptInfo* Unknown() { return reinterpret_cast<ScriptInfo*>(~uintptr_t{0}); }

    // The order of the fields is a contract. Links are written under g_SSILock.
    uint32_t m_Version;
    std::atomic<ScriptInfo*> m_Next{nullptr};
    std::atomic<ScriptInfo*> m_Parent{Unknown()};
    const char* m_Name;
    const char* m_ShortHelp;
    const char* m_LongHelp;
    std::atomic<ScriptSymbol*> m_Symbols{nullptr};
    std::atomic<ScriptSymbol*> m_Opcodes[kOpcodeSlots] = {};
    ScriptVal m_Data;
};

// The object as its class's own pointer. A class that is no ScriptObject takes the address as it
// is: free functions that are published on somebody else's class have such a one.
template <class T>
T* ScriptCast(ScriptObject* object) {
    if constexpr (std::is_base_of_v<ScriptObject, T>) {
        return static_cast<T*>(object);
    } else {
        return reinterpret_cast<T*>(object);
    }
}

template <class T>
class ScriptInfoT : public ScriptInfo {
public:
    using ScriptInfo::ScriptInfo;

    void* _FromObj(void* object) override {
        return ScriptCast<T>(static_cast<ScriptObject*>(object));
    }
    void* _ToObj(void* object) override {
        if constexpr (std::is_base_of_v<ScriptObject, T>) {
            return static_cast<ScriptObject*>(static_cast<T*>(object));
        } else {
            return object;
        }
    }
};

// One member of a class.
//
// Life:    static beside its record, or made at run time. Init puts it on the record, and its
//          destructor takes it away again; it goes before the record.
// Threads: Call runs on any thread, and so does the member if it has SSF_AnyThread.
// Failure: without memory for the name the member cannot be found, without memory for the help tags
//          it has no help.
class KORVEL_EXPORT ScriptSymbol : public Reuser {
public:
    ScriptSymbol();
    ScriptSymbol(const ScriptSymbol&) = delete;
    ScriptSymbol& operator=(const ScriptSymbol&) = delete;
    virtual ~ScriptSymbol();

    // Runs the member, and nothing else: for Call alone.
    virtual void DoCall(ScriptObject* object, ScriptArgs& args, bool set) = 0;

    // Puts the symbol on its class's record: before the others on the list, or in the opcode's slot
    // in place of what was there.
    //   version  1
    //   name     copied; null for an opcode's symbol
    //   flags    the kind or opcode, and SSF_ flags
    //   help     help tags, copied; may be null. The list at g_CurHelp is added to them.
    void Init(unsigned int version, const char* name, unsigned int flags, ScriptInfo& info,
              TagList* help);
    void Init(unsigned int version, const char* name, unsigned int flags, ScriptInfo& info,
              std::initializer_list<HelpTag> help);

    // The only door to a member. Arguments stand in `args` at keys 1, 2 and so on; results come to
    // -1, -2 and so on, an error to "Error".
    //   set  true writes a variable: with argument 1, for what can be read and written
    //
    // Once the host has a UI thread (g_NoGUI), a member without SSF_AnyThread runs there, and the
    // caller waits for it. A member that is paced (SSF_DelayGet, SSF_DelaySet) runs at once, but
    // its replies leave at most every 500 milliseconds for each symbol: how many of them this reply
    // has to wait, at most 500, is left in key "__delay". Without a wait the key stays as it was.
    // Callers in this process need not heed it.
    void Call(ScriptObject* object, ScriptArgs& args, bool set);

    // For a symbol made at run time, before it is deleted: takes it from its class, so that neither
    // a look-up nor a function value leads to it any more. Init would put it back. False while a
    // call that a function value has led to is under way; then ask again.
    bool Withdraw();

    uint32_t GetVersion() const { return m_Version; }
    ScriptInfo* GetInfo() const { return m_Info; }
    const OxID& GetName() const { return m_Name; }
    uint32_t GetFlags() const { return m_Flags; }
    uint32_t GetKind() const { return m_Flags & SST_KindMask; }
    bool IsPresent() const;  // false for a member for debug mode outside of it
    const OxID& GetShortHelp() const { return m_ShortHelp; }
    const OxID& GetLongHelp() const { return m_LongHelp; }
    TagList* GetHelpTags() const { return m_Tags; }         // borrowed; null without memory or Init
    const char* GetAttrName() const { return m_AttrName; }  // null when there is none

private:
    friend class ScriptInfo;
    friend class SymbolRange;
    friend struct LiveSymbolsAccess;
    friend struct ScriptInfoAccess;

    struct CallArgs;
    static unsigned long long DoCall(void* callArgs, void*);
    void Run(ScriptObject* object, ScriptArgs& args, bool set);
    unsigned long long TakeTurn();
    void SetHelp(TagList* help);
    void Enter(unsigned int version, const char* name, unsigned int flags, ScriptInfo& info,
               TagList* help);
    void Leave();

    // The order of the fields is a contract. Fixed after Init, but for what is atomic; links are
    // written under g_SSILock.
    uint32_t m_Version = 0;
    std::atomic<ScriptSymbol*> m_Next{nullptr};  // on the list of its own class
    ScriptInfo* m_Info = nullptr;
    OxID m_Name;
    uint32_t m_Flags = 0;
    uint32_t m_NameProbe = 0;  // tells most other names apart from it
    OxID m_ShortHelp;
    OxID m_LongHelp;
    TagList* m_Tags = nullptr;
    const char* m_AttrName = nullptr;
    std::atomic<unsigned long long> m_NextCallTime;  // milliseconds of Platform::GetUpTime
    std::atomic<ScriptSymbol*> m_RootNext{nullptr};  // a constant's, on the list of the root
    ScriptSymbol* m_NextLive = nullptr;              // LiveSymbols' own
    bool m_IsEntered = false;                        // stands on its record
    std::atomic<uint32_t> m_Holds{0};                // calls that function values have led to
};

// A member that a member function of T, or of a class of its own shape, serves; a virtual one is
// called virtually. Without a function it does nothing.
template <class T>
class ScriptSymbolT : public ScriptSymbol {
public:
    using Function = void (T::*)(ScriptArgs& args, ScriptSymbol* symbol, bool set);

    ScriptSymbolT() = default;
    // Sets the function and calls Init.
    ScriptSymbolT(Function function, const char* name, unsigned int flags, ScriptInfo& info,
                  std::initializer_list<HelpTag> help = {})
        : m_Function(function) {
        Init(1, name, flags, info, help);
    }

    void DoCall(ScriptObject* object, ScriptArgs& args, bool set) override {
        if (m_Function) (ScriptCast<T>(object)->*m_Function)(args, this, set);
    }

    Function m_Function = nullptr;
};

inline SymbolRange::Iterator SymbolRange::begin() const {
    return {&m_List, m_List.m_Symbols.load(std::memory_order_acquire)};
}

// On a list that is not its class's own, a constant has come to the root's.
inline SymbolRange::Iterator& SymbolRange::Iterator::operator++() {
    const auto& link = m_Symbol->m_Info == m_List ? m_Symbol->m_Next : m_Symbol->m_RootNext;
    m_Symbol = link.load(std::memory_order_acquire);
    return *this;
}

// The root of all classes: the parent of those that name none.
KORVEL_EXPORT ScriptInfo& GetRootScriptInfo();

// All records, the newest first. Walk it with GetNext.
KORVEL_EXPORT extern std::atomic<ScriptInfo*> g_ScriptInfoList;

// Tags that the next symbol to be initialised takes over as help; Init resets it to null. Set it
// just before that, on one thread: it is meant for static initialisers.
KORVEL_EXPORT extern TagList* g_CurHelp;

// Guards the links between records and symbols, for writers. It nests. Nothing that blocks and no
// member may run under it.
extern NestedSpinLock g_SSILock;
KORVEL_EXPORT void ObtainSSILock();
KORVEL_EXPORT void ReleaseSSILock();

// For the constructor of a published class, after those of its bases: makes `info` the object's
// record. The object's first class to come here finds its parent, the record set before.
KORVEL_EXPORT void _SetScriptInfo(ScriptObject* object, ScriptInfo& info);

// Names the parent of a record, null for the root's. Does nothing when the parent is known.
KORVEL_EXPORT void _InitScriptInfo(ScriptInfo& info, ScriptInfo* parent);

// Calls a member as a peer does: asks the object's SST_GetTable for the name, and hands the
// function that comes back to its SST_CallFunction, with `args` and the function at key 0. False
// when the object has no such opcodes or the name is no function's. The tags are not used.
KORVEL_EXPORT bool CallScriptFunc(ScriptObject* object, const char* name, ScriptArgs& args,
                                  TagList* tags);

}  // namespace Korvel

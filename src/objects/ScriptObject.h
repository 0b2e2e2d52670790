#pragma once

#include <atomic>
#include <cstdint>

#include "core/0ReusePool.h"
#include "core/OxID.h"
#include "core/ScriptVal.h"
#include "objects/LuaClass.h"

namespace Korvel {

class ScriptInfo;
class TagList;

// Bits of a ScriptObject's flag word.
constexpr uint32_t SOF_HasReference = 0x40000000;  // its destructor clears object references
constexpr uint32_t SOF_Dumped = 0x80000000;        // DumpMem has been here

// The base of everything that scripts can reach.
//
// Lifetime: a ScriptVal on an object holds it by IncRef and DecRef, which may do nothing, and
//           notices through its reference number when it is gone.
// Copying:  a copy is an object of its own, without the original's references.
class KORVEL_EXPORT ScriptObject : public LuaClass, public Reuser {
public:
    ScriptObject() = default;
    ScriptObject(const ScriptObject& other) : LuaClass(other), Reuser(other) {}
    ScriptObject& operator=(const ScriptObject&) { return *this; }
    ~ScriptObject() override;

    // The order of the virtual operations is a contract.

    virtual bool _Do(unsigned int, ScriptVal&) { return false; }
    // The count that a ScriptVal holds. They run while values are copied and released, and must
    // not change the values that are copied.
    virtual void IncRef() = 0;
    virtual void DecRef() = 0;
    // The record of the object's class; null for an object that publishes nothing.
    virtual ScriptInfo* GetScriptInfo() const = 0;
    virtual void SetScriptInfo(ScriptInfo* info) = 0;
    // Answers a query about the object, see DoInfo.
    virtual void GetObjectInfo(const ScriptVal& /*query*/, ScriptVal& /*result*/) {}
    // For GetObjectInfo: true when `key` is wanted. A nil query lists the keys on offer, a text is
    // one key or "*" for all, a table holds true under each key that is wanted.
    virtual bool DoInfo(const ScriptVal& query, ScriptVal& result, const OxID& key);
    // Adds the object's memory to the crash report, unless the lowest bit of `flags` is set.
    virtual void DoDumpMem(unsigned int flags);
    virtual unsigned int SizeOf() { return sizeof(ScriptObject); }
    virtual bool SetAttrsTagList(const TagList& /*tags*/) { return true; }
    // Writes an attribute to where the second argument points, in the type that its tag names;
    // false when there is none.
    virtual bool CopyAttr(unsigned long long /*tag*/, void* /*out*/) const { return false; }
    virtual bool AddNotify(ScriptObject*, OxID, unsigned long long, ScriptVal*, TagList*) {
        return false;
    }
    virtual bool RemoveNotify(unsigned long long, TagList*) { return false; }
    virtual bool RemoveNotify(ScriptObject*, OxID, unsigned long long, TagList*) { return false; }
    virtual bool Notify(unsigned long long, ScriptObject*, OxID, unsigned long long, ScriptVal*,
                        TagList*) {
        return false;
    }
    virtual bool Call(OxID, unsigned long long, ScriptVal*, TagList*) { return false; }

    // Adds the object to the crash report, once. May be called on a null object.
    void DumpMem(unsigned int flags);

    // Objects have no names of their own: the first does nothing, the second gives null.
    void SetObjectName(const char* /*name*/) {}
    const char* GetObjectName() const { return nullptr; }

    // No object of this class can be made by scripts: null.
    static ScriptObject* lw_create(lua_State*) { return nullptr; }

    // Calls by name in this process. Each looks the member up on the object's record and runs it by
    // ScriptSymbol::Call, on the UI thread if it has to be.

    // Any member of that name, a variable or help topic too, with up to 8 arguments at keys 1, 2
    // and so on. Returns the first result; nil when there is none or no such member. Errors of the
    // member are not seen: use InvokeA.
    template <CallArgument... Args>
    requires(sizeof...(Args) <= 8) ScriptVal Invoke(const OxID& name, const Args&... values) {
        ScriptArgs args;
        return args.SetArguments(values...) ? InvokeFirst(name, 0, args, false) : ScriptVal();
    }

    // The same with arguments that stand in `args`, and all results there. False when there is no
    // such member.
    bool InvokeA(const OxID& name, ScriptArgs& args);

    // Reads and writes a variable; nil, or nothing done, when there is no variable of that name.
    ScriptVal InvokeGet(const OxID& name);
    void InvokeSet(const OxID& name, const ScriptVal& value);

private:
    bool InvokeKind(const OxID& name, unsigned int kind, ScriptArgs& args, bool set);
    ScriptVal InvokeFirst(const OxID& name, unsigned int kind, ScriptArgs& args, bool set);

    friend class ObjectReferences;

    mutable std::atomic<uint32_t> m_ObjectFlags{0};
};

}  // namespace Korvel

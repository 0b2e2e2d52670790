#pragma once

#include <atomic>
#include <cstdint>
#include <utility>

#include "core/Export.h"
#include "objects/ScriptObject.h"

namespace Korvel {

class List;  // containers of the host; they stand here as arguments only
class Node;

// The number of uses that a new RefObject starts with, 1 unless a host sets another one. Whoever
// creates an object owns these uses.
extern "C" KORVEL_EXPORT void SetInitUseCount(uint32_t count);
extern "C" KORVEL_EXPORT uint32_t GetInitUseCount();

// A ScriptObject that publishes nothing and is not counted: values on it do not keep it alive.
class KORVEL_EXPORT _Object : public ScriptObject {
public:
    void IncRef() override {}
    void DecRef() override {}
    ScriptInfo* GetScriptInfo() const override { return nullptr; }
    void SetScriptInfo(ScriptInfo* /*info*/) override {}
    unsigned int SizeOf() override { return sizeof(_Object); }
};

// An object with a use count and attributes; most objects that live long are one.
//
// Lifetime: the last Recycle destroys the object, on whatever thread that is. One Recycle too many
//           goes unnoticed. Values on the object do not count as uses.
// Copying:  a copy starts with as many uses as any new object; assignment leaves the count alone.
// Threads:  the count is atomic; attributes are up to the subclass.
class KORVEL_EXPORT RefObject : public _Object {
public:
    RefObject();
    RefObject(const RefObject& other);
    RefObject& operator=(const RefObject& other);

    void GetObjectInfo(const ScriptVal& query, ScriptVal& result) override;  // "UseCount"
    unsigned int SizeOf() override { return sizeof(RefObject); }

    // Called with their class's name (object->RefObject::Use()), the two accept a null object. A
    // plain call goes through the object; ptr<T> tests before it makes one.
    virtual void Use() const;
    virtual void Recycle() const;

    virtual bool DoTagList(unsigned int, TagList&) { return false; }
    virtual bool DoTable(unsigned int, ScriptVal&) { return false; }

    // For containers of the host: a list holds one use of each of its members.
    virtual void OnAddToList(List*, Node*, TagList*) { Use(); }
    virtual void OnRemoveFromList(List*, Node*, TagList*) { Recycle(); }

    // Attributes by tag, read through CopyAttr; the default where the object has none. A subclass
    // writes what the tag's type says: 32 bits for a number or a truth value, 64 for a pointer or a
    // double, an assignment for an identifier. An identifier's tag has the default in all forms but
    // its own, and others have it there.
    uint32_t GetAttr(unsigned long long tag, uint32_t def = 0) const;
    double GetAttrD(unsigned long long tag, double def = 0) const;
    void* GetAttrPtr(unsigned long long tag, void* def = nullptr) const;
    bool GetAttrB(unsigned long long tag, bool def = false) const;
    OxID GetAttrID(unsigned long long tag, const OxID& def = OxID()) const;

    int32_t GetUseCount() const { return UseCount; }  // of interest to debugging and tests only

private:
    uint64_t GetAttrWord(unsigned long long tag, uint64_t word) const;

    mutable std::atomic<int32_t> UseCount;
};

// The use count alone, for what scripts do not reach. It starts at 1, in a copy as well. As with
// RefObject, qualified calls accept a null object.
class KORVEL_EXPORT RefCount {
public:
    RefCount() = default;
    RefCount(const RefCount&) {}
    RefCount& operator=(const RefCount&) { return *this; }
    virtual ~RefCount() = default;

    virtual void Use() const;
    virtual void Recycle() const;

    uint32_t GetUseCount() const { return m_Count; }

private:
    mutable std::atomic<uint32_t> m_Count{1};
};

// Holds one use of an object, or nothing. T is a RefObject, a RefCount, or any class with their Use
// and Recycle.
//
// The constructor takes over a use that the caller owns, as that of an object just created or got
// from TagList::GetObject. Share adds a use to a borrowed object.
template <class T>
class ptr {
public:
    ptr() = default;
    explicit ptr(T* owned) : m_Object(owned) {}
    static ptr Share(T* borrowed) {
        if (borrowed) borrowed->Use();
        return ptr(borrowed);
    }
    ptr(const ptr& other) : ptr(Share(other.m_Object)) {}
    ptr(ptr&& other) noexcept : m_Object(std::exchange(other.m_Object, nullptr)) {}
    ptr& operator=(ptr other) noexcept {
        std::swap(m_Object, other.m_Object);
        return *this;
    }
    ~ptr() {
        if (m_Object) m_Object->Recycle();
    }

    T* Get() const { return m_Object; }
    T* operator->() const { return m_Object; }
    T& operator*() const { return *m_Object; }
    explicit operator bool() const { return m_Object != nullptr; }

    // Gives the use to the caller.
    [[nodiscard]] T* Release() { return std::exchange(m_Object, nullptr); }

private:
    T* m_Object = nullptr;
};

}  // namespace Korvel

#pragma once

#include <concepts>
#include <cstddef>
#include <cstdint>

#include "core/Export.h"
#include "core/OxID.h"
#include "core/OxString.h"
#include "core/RefObject.h"
#include "core/SpinLock.h"

namespace Korvel {

// A tag: bits 31 to 28 are the type of its value, bit 27 says that it may stand several times in a
// list, and the rest is its identity, which the class that defines it chooses.
enum : unsigned long long {
    TAG_TYPE_MASK = 0xF0000000,

    TAG_CONTROL = 0x00000000,   // one of the four below
    TAG_INT = 0x10000000,       // 32 bits, the upper half is 0
    TAG_DOUBLE = 0x20000000,    // a 64-bit float
    TAG_STRING = 0x30000000,    // a text of the list's own, or null
    TAG_OBJECT = 0x40000000,    // a RefObject, of which the list holds one use, or null
    TAG_TAGLIST = 0x50000000,   // a TagList of the list's own, or null
    TAG_PTR = 0x60000000,       // a raw pointer
    TAG_MEMBLOCK = 0x70000000,  // a raw word
    TAG_ID = 0x80000000,        // an OxID, stored in place

    TAG_MULTI = 0x08000000,

    // Control tags. Each has a value word, except for the end.
    TAG_END = 0,
    TAG_IGNORE = 1,  // skips this item
    TAG_SKIP = 2,    // skips this item and as many pairs as the value says, control items too
    TAG_MORE = 3,    // the list goes on at the array that the value points at; null ends it

    // Right behind a text: translate it; the value is a domain or null. See Translate.
    TAG_TRANSLATE = TAG_STRING | TAG_MULTI | 0x02000000,
    TAG_TRANSLATED = TAG_TRANSLATE | 1,
};

constexpr unsigned long long TypeOfTag(unsigned long long tag) {
    return tag & TAG_TYPE_MASK;
}

// A value on its way into an item: made from anything that a list can hold.
class KORVEL_EXPORT TagValue {
public:
    TagValue(unsigned int number) : m_Kind(Kind::Integer), m_Integer(number) {}
    TagValue(int number) : m_Kind(Kind::Integer), m_Integer(number) {}
    // No pointer becomes a truth value by accident.
    template <std::same_as<bool> T>
    TagValue(T value) : TagValue(static_cast<unsigned int>(value)) {}
    TagValue(double number) : m_Kind(Kind::Double), m_Number(number) {}
    TagValue(std::nullptr_t) : TagValue(static_cast<const void*>(nullptr)) {}
    TagValue(const void* pointer) : m_Kind(Kind::Pointer), m_Pointer(pointer) {}
    TagValue(const char* text) : m_Kind(Kind::Text), m_Pointer(text) {}
    TagValue(const OxStringT<char>& text) : TagValue(static_cast<const char*>(text)) {}
    TagValue(const OxID& id);  // shares its cell
    // An object may be derived from several classes: the list needs its RefObject.
    template <std::derived_from<RefObject> T>
    TagValue(const T* object) : TagValue(static_cast<const void*>(object)) {
        m_Object = object;
    }

private:
    friend class TagList;

    enum class Kind { Integer, Double, Pointer, Text };

    Kind m_Kind;
    union {
        long long m_Integer;
        double m_Number;
        const void* m_Pointer;
    };
    const RefObject* m_Object = nullptr;
};

// An attribute list: an array of pairs (tag, value) of 64-bit words, and a last 0.
//
// Array:    a list may borrow a constant array, which must outlive it and costs nothing; the first
//           add makes a private copy. Setting an item of a borrowed array writes straight into it
//           and gives back the old value as if the list owned it, so that is not for texts,
//           objects, lists and identifiers there, and not for constant arrays.
// Order:    items keep their order. They are found by a walk: lists are short.
// Items:    an item is addressed by the pointer to its tag, valid until the list changes. What the
//           readers return is borrowed from the list, except for objects, of which the caller gets
//           a use, and identifiers, which are copies. Nobody checks that the tag's type suits.
// Threads:  any, by a nesting spin lock of the list's own; where the comments say "no lock", the
//           caller holds it or has the list alone. Uses are added under the lock, and given back
//           outside of it, for the last one runs host code; so do not hold the lock yourself where
//           you change or clear a list of objects.
// Failure:  where memory has run out a write has no effect, and Load and Save are false.
// Depth:    lists inside of lists use the stack; there should not be thousands of levels.
class KORVEL_EXPORT TagList : public RefObject {
public:
    TagList();
    // Borrows the array; with `copy` makes it private at once. Null is an empty list.
    explicit TagList(unsigned long long* tags, bool copy = false);
    TagList(const TagList&) = delete;  // SetTags copies
    TagList& operator=(const TagList&) = delete;
    ~TagList() override;

    // What the constructor does, without a release of what the list held before.
    void Init(unsigned long long* tags, bool copy);

    unsigned int SizeOf() override { return sizeof(TagList); }
    bool SetAttrsTagList(const TagList& tags) override;
    bool CopyAttr(unsigned long long tag, void* out) const override { return Get(tag, out); }

    // Makes the array private, without control items and with `spare` words free: two an item.
    virtual void Copy(int spare);

    // Removes all items. An array of the list's own is kept for later.
    void Clear();

    // False as soon as there is any item, even one to ignore.
    bool IsEmpty() const;

    // The items that are no control items, in order; null at the end. No lock.
    unsigned long long* First() const;
    unsigned long long* Next(const unsigned long long* item) const;  // null: the first

    // The first item with exactly this tag, and the next one after `item`, or from the start when
    // that is null. Null when there is none. No lock.
    unsigned long long* Find(unsigned long long tag) const;
    unsigned long long* FindNext(unsigned long long tag, const unsigned long long* item) const;

    bool FindQuery(unsigned long long tag) const;  // whether there is one

    // The lock nests. See NestedSpinLock for what may not happen meanwhile.
    void ObtainLock() const { m_Lock.ObtainLock(); }
    void ReleaseLock() const { m_Lock.ReleaseLock(); }

    // The value of the first item with the tag; the default when there is none.
    unsigned int GetLong(unsigned long long tag, unsigned int def) const;
    int GetInt(unsigned long long tag, int def) const;
    bool GetBool(unsigned long long tag, bool def) const;  // any bit of the value
    double GetDouble(unsigned long long tag, double def) const;
    const char* GetString(unsigned long long tag, const char* def) const;
    const char* GetSafeString(unsigned long long tag, const char* def) const;  // never null
    OxID GetID(unsigned long long tag, const OxID& def) const;
    void* GetPtr(unsigned long long tag, void* def) const;
    TagList* GetTagList(unsigned long long tag, TagList* def) const;
    // With a use for the caller, of the default, too.
    RefObject* GetObject(unsigned long long tag, RefObject* def) const;

    // The same; false, with `out` as it was, when there is no such item. The last form writes what
    // the tag's type says: 32 bits, an OxID, or else the word.
    bool Get(unsigned long long tag, int& out) const;
    bool Get(unsigned long long tag, unsigned int& out) const;
    bool Get(unsigned long long tag, bool& out) const;
    bool Get(unsigned long long tag, double& out) const;
    bool Get(unsigned long long tag, char*& out) const;
    bool Get(unsigned long long tag, OxID& out) const;
    bool Get(unsigned long long tag, TagList*& out) const;
    bool Get(unsigned long long tag, RefObject*& out) const;
    bool Get(unsigned long long tag, void* out) const;

    // The value of an item. No lock.
    static unsigned int GetLong(const unsigned long long* item);
    static bool GetBool(const unsigned long long* item);
    static double GetDouble(const unsigned long long* item);
    static const char* GetString(const unsigned long long* item);
    static const char* GetSafeString(const unsigned long long* item);
    static OxID GetID(const unsigned long long* item);
    static TagList* GetTagList(const unsigned long long* item);
    static void* GetPtr(const unsigned long long* item);
    static RefObject* GetObject(const unsigned long long* item);

    // Writers. Set replaces the value of the first item with the tag; with `add`, an absent one is
    // added. A tag with TAG_MULTI is never looked for: with `add` there is one more. The item forms
    // do nothing for null.
    //
    // Numbers turn into what the tag's type says; a double becomes an integer as ToInt64 tells. A
    // number other than 0 for a text, object, list or identifier, and a text for an object, have no
    // effect. A "text" for a list is taken for a pointer to a list. Texts, identifiers and lists
    // are copied; they may be parts of this list.
    void Set(unsigned long long tag, const TagValue& value, bool add);
    void Set(unsigned long long* item, const TagValue& value);
    void Add(unsigned long long tag, const TagValue& value);

    // The same with the text, object, list or identifier itself as `data`, and for every other type
    // with a pointer to the 64-bit word of the value. The last form appends in any case. Of the
    // control tags, TAG_IGNORE alone may be added.
    void SetData(unsigned long long tag, const void* data, bool add);
    void SetData(unsigned long long* item, const void* data);
    void AddData(unsigned long long tag, const void* data);

    // Sets each item of `other`, as it is when the call begins, in order. Null is an empty list.
    void SetTags(const TagList* other, bool add);

    // Translates each text that has a TAG_TRANSLATE right behind it, with that item's value, or
    // else `domain`, as the domain: the item behind takes the text's tag and the translation, the
    // source text gets the tag TAG_TRANSLATED. Returns how many there are; without g_Translate, or
    // in a list that cannot change, that is all. A borrowed array is made private. No lock.
    int Translate(const char* domain);

    // The byte form, docs/taglist-bytes.md. Save writes to the `size` bytes at `data` and sets
    // `size` to what the form takes; false, with nothing written, when that does not fit. Null for
    // `data` only asks. Objects and raw pointers are left out. Also false, with size 0: nested too
    // deeply, or longer than an int tells, or when a list inside changes meanwhile: then some bytes
    // may be written.
    bool Save(unsigned char* data, int& size) const;

    // Replaces the list by the form at `data`, where `size` bytes are at hand, and sets `size` to
    // how many it took. False, with an empty list and `size` as it was, when the bytes are no such
    // form or memory has run out.
    bool Load(const unsigned char* data, int& size);

private:
    friend struct TagListBytes;

    static constexpr int kMaxDepth = 64;  // of lists in lists, in the byte form
    static const unsigned long long EmptyTags[1];

    static bool CopyValue(unsigned long long tag, unsigned long long& word);
    static bool MakeValue(unsigned long long tag, const void* data, unsigned long long& word);
    static void DropValue(unsigned long long tag, unsigned long long word);
    static bool Resolve(unsigned long long tag, const TagValue& value, unsigned long long& word,
                        const void*& data);

    void Reset();
    void DropItems();
    bool SetAll(const TagList& other, bool add);
    bool JoinRepeated();
    bool OwnsLocked(const unsigned long long* item) const;
    bool BuildLocked(const TagList& from, bool move, int spare);
    bool AppendLocked(unsigned long long tag, unsigned long long word);
    void SwapLocked(TagList& other);

    mutable NestedSpinLock m_Lock;

    // Guarded by m_Lock
    bool m_Owned = false;        // the array is a pool block of the list's own
    unsigned long long* m_Tags;  // the first item
    unsigned long long* m_End;   // the TAG_END of an array of the list's own
    int32_t m_Free = 0;          // spare words behind it
};

// Holds a list's lock until the end of its scope.
class AutoTagListLock {
public:
    explicit AutoTagListLock(const TagList& list) : m_List(list) { m_List.ObtainLock(); }
    AutoTagListLock(const AutoTagListLock&) = delete;
    AutoTagListLock& operator=(const AutoTagListLock&) = delete;
    ~AutoTagListLock() { m_List.ReleaseLock(); }

private:
    const TagList& m_List;
};

// A list that borrows its array for good: what would need an array of its own, adding an item or
// loading, does nothing.
class KORVEL_EXPORT TagListReadOnly : public TagList {
public:
    TagListReadOnly() = default;
    explicit TagListReadOnly(unsigned long long* tags, bool /*copy*/ = false)
        : TagList(tags, false) {}
    ~TagListReadOnly() override;

    void Copy(int spare) override;
};

}  // namespace Korvel

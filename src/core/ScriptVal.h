#pragma once

#include <bit>
#include <concepts>
#include <cstdint>
#include <string>
#include <utility>

#include "core/0ReusePool.h"
#include "core/Export.h"
#include "core/MemBlock.h"
#include "core/OxID.h"
#include "core/OxString.h"

namespace Korvel {

class Packet;
class RemoteApp;
class RemoteObject;
class ScriptArgs;
class ScriptObject;
class ScriptSymbol;
class ScriptVal;
class TableEntry;

// What a value holds: the low 8 bits of its flag word.
enum ScriptValType : uint32_t {
    SV_Nil,
    SV_Number,        // a 64-bit float, integers too
    SV_String,        // a counted text cell and its hash
    SV_Boolean,       // one byte
    SV_Table,         // a chain of entries, searched linearly
    SV_Function,      // a 64-bit reference; in this process a ScriptSymbol*
    SV_RemoteObject,  // a counted proxy of an object at the other end of a connection
    SV_LocalObject,   // an object of this process, and the stamp that tells whether it still lives
    SV_Code,          // a block of compiled code
    SV_MemBlock,      // a block of bytes
    SV_Args,          // the arguments and results of a call; see ScriptArgs
    SV_Ref,           // reserved; setting it gives nil
    SV_Pointer,       // a raw 64-bit pointer, not owned
};

// What stands above the type in the flag word. One bit means different things on different types.
constexpr uint32_t SVF_TypeMask = 0xff;
constexpr uint32_t SVF_Compact = 0x100;           // table: on one line in the text form
constexpr uint32_t SVF_ReadOnly = 0x200;          // setters have no effect; copies do not have it
constexpr uint32_t SVF_Narrow = 0x100000;         // number: came from 32 bits
constexpr uint32_t SVF_Integer = 0x200000;        // number: came from an integer
constexpr uint32_t SVF_Int = 0x300000;            // number: both, a 32-bit integer
constexpr uint32_t SVF_KeptNil = 0x100000;        // nil: counts as present (a null or dead object)
constexpr uint32_t SVF_Foreign = 0x100000;        // local object: neither adds nor gives back a use
constexpr uint32_t SVF_ExplicitKeys = 0x100000;   // table: number keys are always written out
constexpr uint32_t SVF_Ordered = 0x200000;        // table: the order of keys matters
constexpr uint32_t SVF_List = 0x400000;           // table: built from a list
constexpr uint32_t SVF_TableResult = 0x100000;    // function: its results are packed into a table
constexpr uint32_t SVF_AnyThreadFunc = 0x400000;  // function: runs on its caller's thread
constexpr uint32_t SVF_ReplyDeferred = 0x200000;  // args: the reply comes later
constexpr uint32_t SVF_CallDelay = 0x800000;      // args: this call is paced
constexpr uint32_t SVF_ForceDelay = 0x1000000;    // args: the reply of this call waits 500 ms
constexpr uint32_t SVF_FromWire = 0x80000000;     // args: what they cause is printed
constexpr uint32_t SVF_ForeignCode = 0x100000;    // code: came from another process

// How many tables and args lists may stand one in another where values come from outside or leave
// for it: in packets, in Lua, in text, in JSON.
constexpr int kMaxNesting = 256;

// How a value is written as text.
enum TextOptions : unsigned int {
    TXT_Compact = 1,       // every table on one line
    TXT_SingleQuotes = 2,  // around strings
    // Objects, functions and pointers, which else are nil, as what cannot be read back.
    TXT_References = 4,
    TXT_Flat = 8,  // a listing without braces and commas, which cannot be read back either
};

constexpr ScriptValType operator|(ScriptValType type, uint32_t flags) {
    return static_cast<ScriptValType>(static_cast<uint32_t>(type) | flags);
}

// Error numbers of a call, in key "Error" of its args.
enum ScriptError : int {
    SCERR_None,
    SCERR_Unknown,
    SCERR_InvalidArgs,
    SCERR_Unsupported,
    SCERR_NotLoggedIn,
    SCERR_UnknownPacket,
    SCERR_InvalidObject,
    SCERR_NotInitialized,
    SCERR_InvalidIndex,
    SCERR_UnknownSymbol,
    SCERR_InvalidRemoteObject,
};

// The integer types beside int and long long.
template <class T>
concept LongInteger = std::same_as<T, long> || std::same_as<T, unsigned long>;

constexpr long long AsLongLong(long number) {
    return number;
}
constexpr unsigned long long AsLongLong(unsigned long number) {
    return number;
}

// What a call takes as an argument: a value, or what one is made from.
template <class T>
concept CallArgument = std::convertible_to<T, const ScriptVal&>;

// Called with the reply of an asynchronous call.
using AsyncCallback = bool (*)(void* context, RemoteApp* app, Packet* reply, unsigned int id);

// Translates a text; `comment` and `domain` may be null, `number` is −1 where there is none.
using TranslateFunc = OxStringT<char> (*)(const char* domain, const char* text, const char* comment,
                                          long long number);

// Set by a host that can translate, before other threads run; null otherwise. It must not change
// the value or list that is translated.
KORVEL_EXPORT extern TranslateFunc g_Translate;

// The one variant type of the system: every argument, result, attribute table and setting.
//
// Payload:  a value owns what it holds and copies deeply; only text cells are shared. Objects are
//           held by reference: the stamp of a local object tells when it has died, and a dead one
//           reads as null everywhere.
// Tables:   a chain of entries in a definite order. A new number key goes before the first greater
//           number key, any other new key to the end, so number keys ascend and texts keep the
//           order in which they came. Assignment never removes an entry; one that holds nil is
//           skipped in counting and iteration. Look-ups walk the chain from the head, comparing
//           32 bits before a text; a number key at or past the last entry is found at once. A table
//           of thousands of text keys is slow to grow.
// Depth:    values nest as deep as memory allows; no operation uses the stack for it.
// Threads:  one value is used by one thread at a time; values that share text may be used by
//           several.
// Failure:  nothing throws. A look-up that fails gives a sentinel or null, a conversion its
//           default, a value that cannot be built for lack of memory is nil.
// Aliasing: every argument may be a part of the value that is changed. Only a value that is moved
//           must not go into a part of itself.
class KORVEL_EXPORT ScriptVal : public Reuser {
public:
    // Construction; the flags of a number tell what it came from. A text is copied, but that
    // of an identifier with a counted cell shared; no plain text may begin with byte 0xFF.

    constexpr ScriptVal() noexcept : m_Flags(SV_Nil), m_Value{} {}
    ScriptVal(const ScriptVal& other) : m_Flags(other.m_Flags & ~SVF_ReadOnly) {
        if (HasPayload()) {
            CopyPayload(other);
        } else {
            m_Value.m_Word = other.m_Value.m_Word;
        }
    }
    ScriptVal(ScriptVal&& other) noexcept { Take(other); }
    ScriptVal(double number) noexcept : ScriptVal(NumberFlags{0}, number) {}
    ScriptVal(float number) noexcept : ScriptVal(NumberFlags{SVF_Narrow}, number) {}
    ScriptVal(int number) noexcept : ScriptVal(NumberFlags{SVF_Int}, number) {}
    ScriptVal(unsigned int number) noexcept : ScriptVal(NumberFlags{SVF_Integer}, number) {}
    ScriptVal(long long number) noexcept
        : ScriptVal(NumberFlags{SVF_Integer}, static_cast<double>(number)) {}
    ScriptVal(unsigned long long number) noexcept
        : ScriptVal(NumberFlags{SVF_Integer}, static_cast<double>(number)) {}
    template <LongInteger T>
    ScriptVal(T number) noexcept : ScriptVal(AsLongLong(number)) {}
    ScriptVal(const char* text) : ScriptVal() { Set(SV_String, &text); }
    ScriptVal(char* text) : ScriptVal(static_cast<const char*>(text)) {}
    // Exactly `length` bytes, whatever they are: a first byte 0xFF becomes '?'. Below 0 as 0.
    ScriptVal(const char* text, int length) : ScriptVal() { Set(SV_String, &text, length); }
    ScriptVal(const OxID& id) : ScriptVal() { Set(SV_String, &id); }
    // No pointer becomes a boolean by accident.
    template <std::same_as<bool> T>
    ScriptVal(T value) noexcept : m_Flags(SV_Boolean) {
        m_Value.m_Word = value;
    }
    ScriptVal(const MemBlock& block) : ScriptVal() { Set(SV_MemBlock, &block); }
    ScriptVal(ScriptObject* object) : ScriptVal() { Set(SV_LocalObject, &object); }
    ScriptVal(const void* code, uint32_t size, uint32_t args);
    ScriptVal(ScriptValType type, const void* data) : ScriptVal() { Set(type, data); }
    ScriptVal(ScriptValType) = delete;  // it would be the number of the type
    virtual ~ScriptVal() {
        if (HasPayload()) ReleasePayload();
    }

    ScriptVal& operator=(const ScriptVal& other) {
        if (other.HasPayload()) return CopyFrom(other);
        return SetScalar(other.m_Flags & ~SVF_ReadOnly, other.m_Value.m_Word);
    }
    // Takes the payload over, also of and into a read-only value; `other` becomes nil.
    ScriptVal& operator=(ScriptVal&& other) noexcept {
        if (HasPayload() || this == &other) return MoveFrom(other);
        Take(other);
        return *this;
    }
    template <std::same_as<bool> T>
    ScriptVal& operator=(T value) {
        return SetScalar(SV_Boolean, uint64_t{value});
    }
    ScriptVal& operator=(int number) { return SetNumber(SVF_Int, number); }
    ScriptVal& operator=(unsigned int number) { return SetNumber(SVF_Integer, number); }
    ScriptVal& operator=(long long number) {
        return SetNumber(SVF_Integer, static_cast<double>(number));
    }
    ScriptVal& operator=(unsigned long long number) {
        return SetNumber(SVF_Integer, static_cast<double>(number));
    }
    template <LongInteger T>
    ScriptVal& operator=(T number) {
        return *this = AsLongLong(number);
    }
    ScriptVal& operator=(float number) { return SetNumber(SVF_Narrow, number); }
    ScriptVal& operator=(double number) { return SetNumber(0, number); }
    ScriptVal& operator=(const char* text) { return Set(SV_String, &text), *this; }
    ScriptVal& operator=(const OxID& id) { return Set(SV_String, &id), *this; }
    ScriptVal& operator=(const MemBlock& block) { return Set(SV_MemBlock, &block), *this; }
    ScriptVal& operator=(ScriptObject* object) { return Set(SV_LocalObject, &object), *this; }
    ScriptVal& operator=(ScriptValType type) { return Set(type, nullptr), *this; }

    // Sets the value from the payload record that belongs to `type`, which may carry flags. Null
    // gives an empty payload where that makes sense, else nil.
    //   SV_Number        a double
    //   SV_String        a pointer to the text (or an OxID); a null text gives nil
    //   SV_Boolean       a byte
    //   SV_Table         the m_Table record; its chain is copied
    //   SV_Function,
    //   SV_Pointer       a 64-bit value
    //   SV_RemoteObject,
    //   SV_LocalObject   a pointer to the object; a null one gives a kept nil
    //   SV_Code          the m_Code record; its bytes are copied, or zero where the pointer is null
    //   SV_MemBlock      a MemBlock; the same
    //   SV_Args          the m_Args record; its chain is copied
    void Set(ScriptValType type, const void* data);
    // A string of exactly `length` bytes, as the constructor tells; any other type gives nil.
    void Set(ScriptValType type, const char* const* text, int length);

    void CleanUp();  // becomes nil, also when read-only

    // State. The questions and the conversions of this section may be asked of a null value, which
    // is a nil: nest look-ups return null.

    ScriptValType Type() const {
        return IsNull(this) ? SV_Nil : static_cast<ScriptValType>(m_Flags & SVF_TypeMask);
    }
    bool Is(ScriptValType type) const { return Type() == type; }
    bool IsNil() const { return Is(SV_Nil); }
    bool IsNumber() const { return Is(SV_Number); }
    bool IsString() const { return Is(SV_String); }
    bool IsBoolean() const { return Is(SV_Boolean); }
    bool IsTable() const { return Is(SV_Table); }  // false for args
    bool IsFunction() const { return Is(SV_Function); }
    bool IsRemoteObject() const { return Is(SV_RemoteObject); }
    bool IsCode() const { return Is(SV_Code); }
    bool IsMemBlock() const { return Is(SV_MemBlock); }
    bool IsArgs() const { return Is(SV_Args); }
    bool IsPointer() const { return Is(SV_Pointer); }
    bool IsReadOnly() const { return !IsNull(this) && (m_Flags & SVF_ReadOnly) != 0; }
    // A local object or, unless `strict`, a proxy that has a pointer in this process.
    bool IsLocalObject(bool strict) const;
    bool IsValidRemoteObject() const;  // a proxy whose connection is there

    // Anything but a plain nil.
    bool KeepMe() const { return !IsNull(this) && (m_Flags & (SVF_KeptNil | SVF_TypeMask)) != 0; }

    // No entry with a key that is not nil and a value that is kept. True for what is no table.
    bool IsEmpty() const;

    void Ensure(ScriptValType type) {
        if (!Is(static_cast<ScriptValType>(type & SVF_TypeMask))) Set(type, nullptr);
    }

    // The address of the payload; null for a dead local object.
    const void* GetData() const;

    // Copies the payload out, as it is, to a record like Set's; false when the type is another one,
    // and for tables, args, code and nil. A local object may be asked of a proxy that has one; a
    // dead one gives null and true.
    bool Get(ScriptValType type, void* out) const;

    double ToNumber(double def = 0) const { return IsNumber() ? m_Value.m_Number : def; }
    long long ToInteger(long long def = 0) const;  // truncated, saturated; 0 for NaN
    bool ToBoolean(bool def = false) const { return IsBoolean() ? m_Value.m_Boolean : def; }
    // Borrowed from the value. Numbers do not convert.
    const char* ToString(const char* def = nullptr) const {
        return IsString() ? m_Value.m_String.m_String + 1 : def;
    }
    OxStringT<char> ToOxStringA(const char* def = nullptr) const { return ToString(def); }
    uint64_t ToFunction(uint64_t def = 0) const { return IsFunction() ? m_Value.m_Function : def; }
    void* ToPointer(void* def = nullptr) const {
        return IsPointer() ? reinterpret_cast<void*>(m_Value.m_Pointer) : def;
    }
    RemoteObject* ToRemoteObject(RemoteObject* def = nullptr) const {
        return IsRemoteObject() ? m_Value.m_RemoteObject : def;
    }
    // Null for a dead object.
    ScriptObject* ToLocalObject(ScriptObject* def = nullptr) const;
    MemBlock ToMemBlock() const;  // a view: not to be freed
    const void* ToCodePtr() const { return IsCode() ? m_Value.m_Code.m_Ptr : nullptr; }
    uint32_t ToCodeLen() const { return IsCode() ? m_Value.m_Code.m_Size : 0; }
    uint32_t ToCodeArgs() const { return IsCode() ? m_Value.m_Code.m_Args : 0; }
    // A number as it is, or a table of "R", "G", "B" and "A" from 0 to 1 as R | G << 8 | B << 16 |
    // A << 24, not clamped.
    uint32_t ToColor(uint32_t def = 0) const;

    // For double, int, bool, float, long long, unsigned long long, void* and std::string. To gives
    // false, and leaves `out` alone, when the type is another one; int takes numbers below 2^32 by
    // their bits. From is always true. The text is not used.
    template <class T>
    bool To(T& out, const char* = nullptr) const;
    template <class T>
    bool From(const T& value, const char* = nullptr);

    // Look-up, in tables and args. A key that is absent is made by the plain forms, with the value
    // nil; the Const forms give `nil`. What is no table gives `invalid`, a nil of the thread's own
    // that forgets what is written to it, or null. A read-only table makes no entry and gives
    // `invalid`.

    ScriptVal& FindKey(const ScriptVal& key);
    ScriptVal& FindKey(const char* key);
    ScriptVal& FindKey(const char* key, int length);
    // The flags of the key, found or new, lose the bits of `clear` and then gain those of `set`.
    // Positional lists pass SVF_Int for both.
    ScriptVal& FindKey(double key, uint32_t set = 0, uint32_t clear = 0);
    template <std::integral K>
    ScriptVal& FindKey(K key, uint32_t set = 0, uint32_t clear = 0) {
        return FindKey(static_cast<double>(key), set, clear);
    }
    ScriptVal& FindKey(const OxID& key) { return FindKey(static_cast<const char*>(key)); }
    template <class K>
    ScriptVal& operator[](const K& key) {
        return FindKey(key);
    }

    const ScriptVal& FindKeyConst(const ScriptVal& key) const;
    const ScriptVal& FindKeyConst(const char* key) const;
    const ScriptVal& FindKeyConst(const char* key, int length) const;
    const ScriptVal& FindKeyConst(double key) const;
    template <std::integral K>
    const ScriptVal& FindKeyConst(K key) const {
        return FindKeyConst(static_cast<double>(key));
    }
    const ScriptVal& FindKeyConst(const OxID& key) const {
        return FindKeyConst(static_cast<const char*>(key));
    }
    template <class K>
    const ScriptVal& operator[](const K& key) const {
        return FindKeyConst(key);
    }

    // The case of A to Z set aside. What is no table gives null; so do the Const forms for a key
    // that is absent. The forms for any key look texts up this way and other keys as FindKey does,
    // and make nothing.
    ScriptVal* FindKeyNoCase(const char* key);
    ScriptVal* FindKeyNoCase(const char* key, int length);
    ScriptVal* FindKeyNoCase(const ScriptVal& key);
    const ScriptVal* FindKeyNoCaseConst(const char* key) const;
    const ScriptVal* FindKeyNoCaseConst(const char* key, int length) const;
    const ScriptVal* FindKeyNoCaseConst(const ScriptVal& key) const;
    const ScriptVal* FindKeyNoCaseConst(double key) const;
    template <std::integral K>
    const ScriptVal* FindKeyNoCaseConst(K key) const {
        return FindKeyNoCaseConst(static_cast<double>(key));
    }
    ScriptVal* FindKeyNoCase(const OxID& key) {
        return FindKeyNoCase(static_cast<const char*>(key));
    }
    const ScriptVal* FindKeyNoCaseConst(const OxID& key) const {
        return FindKeyNoCaseConst(static_cast<const char*>(key));
    }

    bool Exists(const ScriptVal& key) const;

    // Walks a path of keys "a.b.3" through tables; a segment that is a whole number, or empty (0),
    // is a number key. With `create` the tables on the way are made, in place of other values,
    // without it they must be there; the last key is made in any case. Null when the walk fails.
    // The Const forms make nothing: for an absent last key they give `nil`, or null without case.
    ScriptVal* FindKeyNest(const char* path, bool create);
    ScriptVal* FindKeyNest(const ScriptVal& path, bool create) {
        return FindKeyNest(path.ToString(nullptr), create);
    }
    ScriptVal* FindKeyNest(const OxID& path, bool create) {
        return FindKeyNest(static_cast<const char*>(path), create);
    }
    ScriptVal* FindKeyNoCaseNest(const char* path, bool create);
    ScriptVal* FindKeyNoCaseNest(const ScriptVal& path, bool create) {
        return FindKeyNoCaseNest(path.ToString(nullptr), create);
    }
    ScriptVal* FindKeyNoCaseNest(const OxID& path, bool create) {
        return FindKeyNoCaseNest(static_cast<const char*>(path), create);
    }
    const ScriptVal* FindKeyNestConst(const char* path) const;
    const ScriptVal* FindKeyNestConst(const ScriptVal& path) const {
        return FindKeyNestConst(path.ToString(nullptr));
    }
    const ScriptVal* FindKeyNestConst(const OxID& path) const {
        return FindKeyNestConst(static_cast<const char*>(path));
    }
    const ScriptVal* FindKeyNoCaseNestConst(const char* path) const;
    const ScriptVal* FindKeyNoCaseNestConst(const ScriptVal& path) const {
        return FindKeyNoCaseNestConst(path.ToString(nullptr));
    }
    const ScriptVal* FindKeyNoCaseNestConst(const OxID& path) const {
        return FindKeyNoCaseNestConst(static_cast<const char*>(path));
    }

    // Appends a text key to a table without looking whether it is there: the caller vouches for
    // that. Otherwise the same as FindKey.
    ScriptVal& AddKey(const ScriptVal& key);
    ScriptVal& AddKey(ScriptVal&& key);

    // Entries whose key is not nil and whose value is kept: their number, and a walk over them from
    // a null `entry`, which ends with false and null.
    unsigned int NumKeys() const;
    bool NextKey(TableEntry*& entry) const;

    // Read and write a key of a table, or of the object behind a proxy by asking its process.
    // Reading an absent key of a table leaves an entry with nil. Other types read nil and write
    // nothing.
    ScriptVal GetKey(const char* key);
    ScriptVal GetKey(double key);
    void SetKey(const char* key, const ScriptVal& value);
    void SetKey(double key, const ScriptVal& value);

    // Tables only. SetTable takes over a chain of entries with different keys, putting number keys
    // in order; it does not release the former chain, which the caller has taken. A value that is
    // no table, or read-only, leaves the new chain to the caller. TakeTable gives the chain up to
    // the caller and leaves an empty table; null for other types and for a read-only value.
    void SetTable(TableEntry* chain);
    TableEntry* TakeTable();

    // The name of a table's constructor in the text form, or null. Tables only.
    const char* GetConstructor() const;
    void SetConstructor(const char* name);
    void SetConstructor(const OxID& name);

    // Set or clear flag bits (never the type) on every value of type `type`: this one and, as
    // asked, the keys and the values under it.
    void SetFlagsRecurse(uint32_t flags, ScriptValType type, bool keys, bool values);
    void ClearFlagsRecurse(uint32_t flags, ScriptValType type, bool keys, bool values);

    // Equality by content. Tables are equal when each entry (as NumKeys counts) has an equal one
    // that is not nil, in any order; flags and constructors do not count. Proxies are equal when
    // they stand for the same object of the same connection, dead objects always; functions, code,
    // args and pointers are never equal, not even to themselves.
    bool operator==(const ScriptVal& other) const;
    bool operator==(double number) const { return IsNumber() && m_Value.m_Number == number; }
    template <std::integral T>
    bool operator==(T number) const {
        return *this == static_cast<double>(number);
    }
    bool operator==(bool value) const { return IsBoolean() && m_Value.m_Boolean == value; }
    bool operator==(const char* text) const;  // null equals nothing
    bool operator==(const OxID& id) const { return *this == static_cast<const char*>(id); }

    // Adds what `other` holds. A nil takes a copy; two tables are merged key by key, at all levels;
    // two values of any other equal type: a copy; different types: nothing.
    ScriptVal& operator+=(const ScriptVal& other);

    // Takes away what `other` holds: an equal value becomes nil. A table loses the entries that
    // `other` has equally, at all levels, and becomes nil itself once nothing else is left.
    ScriptVal& operator-=(const ScriptVal& other);

    // Replaces every table with the constructor "__tr" by its translation, at all levels of a table
    // or args list, and returns how many there were. Such a table holds the text, a comment, a
    // number and a domain at keys 1 to 4. Without g_Translate the text stands as it is.
    int Translate(const char* domain);

    // Sets key "Error" of a table or args list to the code, and "ErrorString" to the text; without
    // one, to the usual text of the code. A read-only value at "Error" stays.
    void SetError(ScriptError code, const char* text = nullptr);

    // Prints the value to standard output, for debugging.
    void Dump(int indent = 0, bool newline = true) const;

    // Makes an array of plain numbers, at keys 1 to `count`.
    template <class T>
    void TableFromArray(const T* values, int count);

    // A fresh random UUID as text.
    static ScriptVal CreateUUID();
    static void CreateUUID(ScriptVal& value);

    // The text form (docs/textform.md): a table constructor of Lua with a few forms more, which is
    // read by running it. `options` are bits of TextOptions. `indent` counts tabs; a negative one
    // writes none at its level, and each level below has one more. Writing at a level below 1 puts
    // the process into the "C" locale. The value must not change meanwhile.

    // The bytes of the text, without a NUL; -1 for 2 GiB and more, and for tables that nest deeper
    // than kMaxNesting.
    int ToTextLen(int indent, unsigned int options) const;
    // Writes the text and a NUL to a buffer of ToTextLen + 1 bytes, which must not have been -1.
    // Returns where the NUL is.
    char* ToText(char* buffer, int indent, unsigned int options) const;
    // False, with `out` empty, where there is no length, and without memory.
    bool ToText(OxStringT<char>& out, int indent, unsigned int options) const;
    // Writes the text to a file, in place of what that holds. False, and the file untouched, as
    // above; also when it cannot be opened, or not all of it could be written.
    bool Save(const char* file, unsigned int options) const;

    // The readers run the text as a program of the own process: they are not for text that others
    // can write. The value is nil when they fail, and they read functions as code.
    //   err      may be null; else room for `errlen` bytes, which take the message of a failure. On
    //            entry it may hold the name of the text for messages. After a success it is empty,
    //            or holds the text of a string or number that was read.
    //   options  is not used

    // Reads a file. One that cannot be read leaves the value and `err` as they are.
    bool Load(const char* file, char* err, int errlen, unsigned int options);
    // Reads an expression; unknown names in it become constructors.
    bool FromText(const char* text);
    // Reads an expression behind `prefix`: GetSerializePrologue(), or another text that ends in
    // "return "; null is just that. With `freeText` the text comes from malloc, and is freed.
    bool FromText(const char* text, const char* prefix, char* err, int errlen, bool freeText,
                  unsigned int options);
    // Runs statements and reads the global variable, or field ("a.b"), of that name.
    bool FromTextByName(const char* text, const char* name, char* err, int errlen, bool freeText,
                        unsigned int options);

    // JSON. A table with an entry at number key 1 is an array of all its values, any other one an
    // object of what stands under text keys. A number that JSON does not have becomes null, and
    // what is no nil, number, text, boolean or table is left out. False, with `out` unchanged, for
    // what is left out as a whole, for nesting deeper than kMaxNesting, and without memory.
    bool ToJSON(OxStringT<char>& out) const;
    // False, with the value unchanged, for what is no JSON or nests too deeply, for texts with a
    // NUL or with byte 0xFF in front, for a read-only value, and without memory. A number that is
    // too large becomes nil.
    bool FromJSON(const OxStringT<char>& text);

    // The wire form (docs/protocol.md). Objects are counted on the connection. Without one they
    // come in as nil, and without one that is open they go out without a number. Defined with the
    // connections.

    // The bytes that ToPkt writes; 0 for a value that nests deeper than kMaxNesting or would take
    // more than 32 bits can tell.
    uint32_t CalcPktSize() const;
    // Writes the value to where the cursor points and moves that to the end. There must be as much
    // room as CalcPktSize told, which must not be 0.
    bool ToPkt(RemoteApp* app, unsigned char*& cursor) const;
    // Reads the value from bytes that need not be trusted, never past `end`, and moves the cursor
    // behind it. False for what is no value, and when memory has run out: the value is nil then,
    // and the cursor stays.
    bool FromPkt(RemoteApp* app, unsigned char*& cursor, const unsigned char* end);

    // Packets; null as CreatePkt tells. A call of an object's member, by an opcode or a kind of
    // symbol, with its arguments as the second value.
    static Packet* ToPacket(RemoteApp* app, uint32_t target, int symbol, const ScriptVal* first,
                            const ScriptVal* second);
    static Packet* ToPacket(RemoteObject* object, int symbol, const ScriptVal* first,
                            const ScriptVal* second);
    // The reply to a call, with the results of `args` and its error, if it has one; a null `args`
    // has no results. Results that no packet can take become the error "Packet too large.".
    static Packet* ToReply(RemoteApp* app, uint32_t context, const ScriptVal* first,
                           ScriptVal* args);
    static Packet* ToReply(RemoteObject* object, Packet* request, const ScriptVal* first,
                           ScriptVal* args);
    // Reads both values; a null destination throws one away, an args list keeps its context. The
    // error of a reply becomes the connection's last one. False, with nothing changed, when these
    // are not just two values.
    static bool FromPacket(RemoteApp* app, Packet* packet, ScriptVal* first, ScriptVal* second);
    static bool FromPacket(RemoteObject* object, Packet* packet, ScriptVal* first,
                           ScriptVal* second);

    // Calls. The connection of a proxy or args list, borrowed, else null; SetApp is for args only.
    RemoteApp* GetApp() const;
    void SetApp(RemoteApp* app);

    // Calls a function of the object by name and returns its first result. Nil when this is no
    // object, the object is dead, it has no such function, or its process cannot be reached. To a
    // proxy, `args` itself is sent, with the name at key 0.
    ScriptVal CallMemberA(const char* name, ScriptArgs& args);

    // Sends the call and returns at once; the callback gets the reply. False when this is no proxy
    // or nothing could be sent.
    bool AsyncCallMemberA(AsyncCallback callback, void* context, const char* name,
                          ScriptArgs& args);

    // The same with up to 8 arguments, which become keys 1, 2 and so on.
    template <CallArgument... Args>
    requires(sizeof...(Args) <= 8) ScriptVal CallMember(const char* name, const Args&... args);
    template <CallArgument... Args>
    requires(sizeof...(Args) <= 8) bool AsyncCallMember(AsyncCallback callback, void* context,
                                                        const char* name, const Args&... args);

    ScriptVal DoAction(const char* action, const ScriptVal& args);
    bool QueueAction(const char* action, const ScriptVal& args);  // always true

    // The read-only nil that Const look-ups give for an absent key.
    static const ScriptVal& nil;

    // It holds something that it will give back: all but nil, numbers, booleans, functions and
    // pointers. Not for a null value.
    bool HasPayload() const {
        constexpr uint32_t types = 1u << SV_String | 1u << SV_Table | 1u << SV_RemoteObject |
                                   1u << SV_LocalObject | 1u << SV_Code | 1u << SV_MemBlock |
                                   1u << SV_Args;
        return (types >> (m_Flags & 31) & 1) != 0;
    }

    struct TablePayload {
        TableEntry* m_Table;
        TableEntry* m_Last;
        char* m_Constructor;  // a text cell or null
    };
    struct ArgsPayload {
        TableEntry* m_Table;
        RemoteApp* m_App;
        uint32_t m_Context;
        uint8_t m_NumReturns;
        uint8_t m_pad;
        uint16_t m_Run;  // of the connection; 0 for any
    };
    struct BlockPayload {
        void* m_Ptr;
        uint32_t m_Size;
        uint32_t m_Args;  // code only
    };
    union Payload {
        TablePayload m_Table;  // first, so that {} clears all of the union
        double m_Number;
        struct {
            char* m_String;  // a text cell
            uint32_t m_Hash;
            uint32_t m_Probe;  // four bytes of the text, for look-ups
        } m_String;
        bool m_Boolean;
        RemoteObject* m_RemoteObject;
        struct {
            ScriptObject* m_Object;
            uint64_t m_Ref;
        } m_LocalObject;
        uint64_t m_Function;
        uint64_t m_Pointer;
        uint64_t m_Word;  // all there is of what is not owned: number, boolean, function, pointer
        struct {
            void* m_Ptr;
            uint32_t m_Size;
        } m_MemBlock;
        BlockPayload m_Code;
        ArgsPayload m_Args;
    };

    // Scripts read these fields where they lie; do not write them.
    union {
        uint32_t m_Type;
        uint32_t m_Flags;
    };
    Payload m_Value;

private:
    friend class TableEntry;

    // A nil whose payload is left as it is in memory.
    struct Unfilled {};
    explicit ScriptVal(Unfilled) noexcept : m_Flags(SV_Nil) {}
    struct NumberFlags {
        uint32_t m_Flags;
    };
    ScriptVal(NumberFlags flags, double number) noexcept : m_Flags(SV_Number | flags.m_Flags) {
        m_Value.m_Number = number;
    }

    // What follows writes no more of a payload than there is: short stores that a long load comes
    // after cost more than the whole copy.

    void CopyPayload(const ScriptVal& other);  // into a value that holds nothing
    ScriptVal& CopyFrom(const ScriptVal& other);
    ScriptVal& MoveFrom(ScriptVal& other);
    void Take(ScriptVal& other) {  // into a value that holds nothing
        m_Flags = other.m_Flags;
        if (HasPayload()) {
            m_Value = other.m_Value;
        } else {
            m_Value.m_Word = other.m_Value.m_Word;
        }
        other.m_Flags = SV_Nil;
    }
    void ReleasePayload() { Release(std::exchange(m_Flags, SV_Nil), m_Value); }

    static void Release(uint32_t flags, const Payload& payload);
    ScriptVal& SetScalar(uint32_t flags, uint64_t word) {
        if (m_Flags & SVF_ReadOnly) return *this;
        if (HasPayload()) return ReplacePayload(flags, word);
        m_Flags = flags;
        m_Value.m_Word = word;
        return *this;
    }
    ScriptVal& ReplacePayload(uint32_t flags, uint64_t word);
    ScriptVal& SetNumber(uint32_t flags, double number) {
        return SetScalar(SV_Number | flags, std::bit_cast<uint64_t>(number));
    }
};

// Defined for these types.
template <>
KORVEL_EXPORT bool ScriptVal::To(double& out, const char*) const;
template <>
KORVEL_EXPORT bool ScriptVal::To(float& out, const char*) const;
template <>
KORVEL_EXPORT bool ScriptVal::To(int& out, const char*) const;
template <>
KORVEL_EXPORT bool ScriptVal::To(long long& out, const char*) const;
template <>
KORVEL_EXPORT bool ScriptVal::To(unsigned long long& out, const char*) const;
template <>
KORVEL_EXPORT bool ScriptVal::To(bool& out, const char*) const;
template <>
KORVEL_EXPORT bool ScriptVal::To(void*& out, const char*) const;
template <>
KORVEL_EXPORT bool ScriptVal::To(std::string& out, const char*) const;
template <>
KORVEL_EXPORT bool ScriptVal::From(const double& value, const char*);
template <>
KORVEL_EXPORT bool ScriptVal::From(const float& value, const char*);
template <>
KORVEL_EXPORT bool ScriptVal::From(const int& value, const char*);
template <>
KORVEL_EXPORT bool ScriptVal::From(const long long& value, const char*);
template <>
KORVEL_EXPORT bool ScriptVal::From(const unsigned long long& value, const char*);
template <>
KORVEL_EXPORT bool ScriptVal::From(const bool& value, const char*);
template <>
KORVEL_EXPORT bool ScriptVal::From(void* const& value, const char*);
template <>
KORVEL_EXPORT bool ScriptVal::From(const std::string& value, const char*);
template <>
KORVEL_EXPORT void ScriptVal::TableFromArray(const double* values, int count);

// One key and its value in the chain of a table or args list. The entry owns both; the chain's
// owner owns the entry.
class KORVEL_EXPORT TableEntry : public Reuser {
public:
    TableEntry() noexcept : m_Key(ScriptVal::Unfilled{}), m_Value(ScriptVal::Unfilled{}) {}
    explicit TableEntry(double key) noexcept : m_Key(key), m_Value(ScriptVal::Unfilled{}) {}
    explicit TableEntry(const ScriptVal& key) : m_Key(key), m_Value(ScriptVal::Unfilled{}) {}
    explicit TableEntry(ScriptVal&& key) noexcept
        : m_Key(std::move(key)), m_Value(ScriptVal::Unfilled{}) {}

    TableEntry* m_Next = nullptr;
    ScriptVal m_Key;
    ScriptVal m_Value;
};

// The arguments of a call and its results, with what is needed to send a reply.
//
// Number keys are positions: arguments from 1 up, results from −1 down, the member's name at 0 in
// a call by opcode. Text keys such as "Error" live beside them. It holds a use of its connection.
class KORVEL_EXPORT ScriptArgs : public ScriptVal {
public:
    ScriptArgs() {
        m_Flags = SV_Args;
        m_Value.m_Args = {};
    }
    // A copy has no connection, no context and no count of results.
    ScriptArgs(const ScriptArgs& other) = default;
    ScriptArgs& operator=(const ScriptArgs& other) = default;
    using ScriptVal::operator=;
    ~ScriptArgs() override = default;

    // A slot for one more result. At most 255 results can be told apart.
    ScriptVal& Return();
    void Return(const ScriptVal& value) { Return() = value; }
    void ReturnNumber(double number) { Return() = number; }
    void ReturnString(const char* text) { Return() = text; }
    void ReturnBoolean(bool value) { Return() = value; }
    void ReturnNil() { Return() = SV_Nil; }
    void ReturnMemBlock(const MemBlock& block) { Return() = block; }
    void ReturnCode(const void* code, uint32_t size, uint32_t args);
    void ReturnObject(ScriptObject* object) { Return() = object; }  // null as a kept nil
    void ReturnFunction(ScriptSymbol* symbol);

    // The first result, moved out: the list does not have it afterwards. Nil when there is none.
    ScriptVal TakeResult();

    // Puts a copy of a value at a position. False when memory has run out, or when the list or what
    // stands there is read-only.
    bool SetPosition(int position, const ScriptVal& value);

    // Puts the values at keys 1, 2 and so on. Quickest in a list that has no entries yet. False as
    // above: then some may be missing.
    bool SetArguments(const ScriptVal* const* values, int count);
    // The same for any types that values are made from.
    template <CallArgument... Args>
    bool SetArguments(const Args&... values) {
        return SetValues(static_cast<const ScriptVal&>(values)...);
    }

    // For a member that answers later: moves this list into a new one, which the caller owns, and
    // marks this one, so that no reply is sent for it. Null when there is nothing to reply to, when
    // it has been done before, and without memory.
    ScriptArgs* DeferReply();

    // Sends the list as the reply to its call. False when there is nothing to reply to.
    bool SendReply();

private:
    bool SetValues() { return true; }
    template <std::same_as<ScriptVal>... Values>
    bool SetValues(const Values&... values) {
        const ScriptVal* list[] = {&values...};
        return SetArguments(list, static_cast<int>(sizeof...(Values)));
    }
};

static_assert(sizeof(ScriptArgs) == sizeof(ScriptVal));

template <CallArgument... Args>
requires(sizeof...(Args) <= 8) ScriptVal ScriptVal::CallMember(const char* name,
                                                               const Args&... values) {
    ScriptArgs args;
    return args.SetArguments(values...) ? CallMemberA(name, args) : ScriptVal();
}

template <CallArgument... Args>
requires(sizeof...(Args) <= 8) bool ScriptVal::AsyncCallMember(AsyncCallback callback,
                                                               void* context, const char* name,
                                                               const Args&... values) {
    ScriptArgs args;
    return args.SetArguments(values...) && AsyncCallMemberA(callback, context, name, args);
}

}  // namespace Korvel

// What a value is made of: setting, copying and releasing payloads, and the conversions.
#include "core/ScriptVal.h"

#include <cmath>
#include <cstddef>
#include <new>

#include "Platform/Processes.h"
#include "core/NumbersInternal.h"
#include "core/ScriptHooksInternal.h"
#include "core/ScriptValInternal.h"
#include "objects/ObjectReferences.h"
#include "objects/ScriptObject.h"

namespace Korvel {

// Scripts read these fields where they lie. A boolean is the first byte of its word.
static_assert(std::endian::native == std::endian::little);
static_assert(sizeof(ScriptVal) == 40 && offsetof(ScriptVal, m_Flags) == 8 &&
              offsetof(ScriptVal, m_Value) == 16);
static_assert(sizeof(TableEntry) == 88 && offsetof(TableEntry, m_Key) == 8 &&
              offsetof(TableEntry, m_Value) == 48);

TranslateFunc g_Translate = nullptr;

// The one value that no static destructor touches: others may still be read at exit.
union ImmortalNil {
    constexpr ImmortalNil() : m_Value() { m_Value.m_Flags = SVF_ReadOnly; }
    ~ImmortalNil() {}

    ScriptVal m_Value;
};

namespace {

constinit ImmortalNil s_Nil;
constinit thread_local ScriptVal t_Invalid;

// The bits that a copy takes over.
constexpr ScriptValType CopiedFlags(const ScriptVal& from) {
    return static_cast<ScriptValType>(from.m_Flags & ~SVF_ReadOnly);
}

// A pool block with the bytes at `from`, or zeros; false without memory. No bytes need no block.
bool CopyBlock(void*& to, const void* from, uint32_t size) {
    to = nullptr;
    if (size == 0) return true;
    to = g_ReusePoolMgr.Alloc(size);
    if (!to) return false;
    if (from) {
        memcpy(to, from, size);
    } else {
        memset(to, 0, size);
    }
    return true;
}

// Of a local object.
bool IsAlive(const ScriptVal::Payload& payload) {
    ScriptObject* object = payload.m_LocalObject.m_Object;
    return object && ObjectReferences::GetObjectReference(object) == payload.m_LocalObject.m_Ref;
}

// Copying goes list by list, without recursion. A list that is not copied yet waits in its copy,
// which is on this stack: its chain is then still the source's, and the link to the list that waits
// below it stands where a table has its last entry and an args list its connection.
class WaitingLists {
public:
    void Push(ScriptVal& copy, TableEntry* source) {
        copy.m_Value.m_Table.m_Table = source;
        copy.m_Value.m_Table.m_Last = reinterpret_cast<TableEntry*>(m_Top);
        m_Top = &copy;
    }

    // Takes the top list, which becomes empty, and its source.
    ScriptVal* Pop(const TableEntry*& source) {
        ScriptVal* copy = m_Top;
        if (!copy) return nullptr;
        ScriptVal::TablePayload& payload = copy->m_Value.m_Table;
        source = payload.m_Table;
        m_Top = reinterpret_cast<ScriptVal*>(payload.m_Last);
        payload.m_Table = nullptr;
        payload.m_Last = nullptr;
        return copy;
    }

private:
    ScriptVal* m_Top = nullptr;
};

// Copies a value with a payload into a nil, and leaves the chain of a list waiting. False without
// memory.
bool CopyShallow(const ScriptVal& from, ScriptVal& to, WaitingLists& waiting) {
    switch (from.Type()) {
        case SV_String:
            TextCell::Use(from.m_Value.m_String.m_String);
            to.m_Value.m_String = from.m_Value.m_String;
            to.m_Flags = CopiedFlags(from);
            return true;
        case SV_Table:
            to.m_Flags = CopiedFlags(from);
            to.m_Value.m_Table = {};
            to.m_Value.m_Table.m_Constructor =
                const_cast<char*>(TextCell::Use(from.m_Value.m_Table.m_Constructor));
            if (Chain::Head(from)) waiting.Push(to, Chain::Head(from));
            return true;
        case SV_Args:
            to.m_Flags = CopiedFlags(from);
            to.m_Value.m_Args = {};
            if (Chain::Head(from)) waiting.Push(to, Chain::Head(from));
            return true;
        case SV_LocalObject:
            if (!IsAlive(from.m_Value)) {
                to.m_Flags = SVF_KeptNil;
                return true;
            }
            to.m_Flags = CopiedFlags(from);
            to.m_Value.m_LocalObject = from.m_Value.m_LocalObject;
            if (!(from.m_Flags & SVF_Foreign)) from.m_Value.m_LocalObject.m_Object->IncRef();
            return true;
        default:
            to.Set(CopiedFlags(from), &from.m_Value);  // proxies and blocks
            return !to.IsNil();
    }
}

// The same for any value.
inline bool CopyPart(const ScriptVal& from, ScriptVal& to, WaitingLists& waiting) {
    if (from.HasPayload()) return CopyShallow(from, to, waiting);
    to.m_Flags = CopiedFlags(from);
    to.m_Value.m_Word = from.m_Value.m_Word;
    return true;
}

bool CopyWaiting(WaitingLists& waiting) {
    const TableEntry* from = nullptr;
    while (ScriptVal* to = waiting.Pop(from)) {
        TableEntry* last = nullptr;
        for (TableEntry** link = &to->m_Value.m_Table.m_Table; from; from = from->m_Next) {
            TableEntry* entry = NewEntry();
            if (!entry) return false;
            last = *link = entry;
            link = &entry->m_Next;
            if (!CopyPart(from->m_Key, entry->m_Key, waiting) ||
                !CopyPart(from->m_Value, entry->m_Value, waiting)) {
                return false;
            }
        }
        if (to->IsTable()) to->m_Value.m_Table.m_Last = last;
    }
    return true;
}

// Fills a nil with a copy; without memory it stays a nil.
void CopyInto(ScriptVal& to, const ScriptVal& from) {
    WaitingLists waiting;
    if (CopyShallow(from, to, waiting) && CopyWaiting(waiting)) return;
    const TableEntry* unused = nullptr;
    while (waiting.Pop(unused)) {
    }
    to.CleanUp();
}

// Fills a nil from a payload record.
void Make(ScriptVal& value, ScriptValType type, const void* data) {
    ScriptVal::Payload& payload = value.m_Value;
    auto read = [data](auto& field) { memcpy(&field, data, sizeof field); };
    switch (type & SVF_TypeMask) {
        case SV_Nil:
            value.m_Flags = type;
            break;
        case SV_Number:
            value.m_Flags = type;
            payload.m_Number = 0;
            if (data) read(payload.m_Number);
            break;
        case SV_String: {
            const char* text = "";
            if (data) read(text);
            if (const char* cell = text ? TextCell::UseOrCopy(text) : nullptr) {
                AdoptText(value, type, cell, strlen(cell + 1));
            }
            break;
        }
        case SV_Boolean:
            value.m_Flags = type;
            payload.m_Boolean = data && *static_cast<const unsigned char*>(data) != 0;
            break;
        case SV_Function:
        case SV_Pointer:
            if (!data) break;
            value.m_Flags = type;
            read(payload.m_Function);
            break;
        case SV_Table: {
            ScriptVal list;
            list.m_Flags = type;
            list.m_Value.m_Table = {};
            if (data) list.m_Value.m_Table = *static_cast<const ScriptVal::TablePayload*>(data);
            CopyInto(value, list);
            list.m_Flags = SV_Nil;
            if (value.IsTable()) value.m_Flags = type;
            // A host may give its constructor as a plain text.
            if (char*& name = value.m_Value.m_Table.m_Constructor;
                value.IsTable() && name && !TextCell::IsCell(name)) {
                name = TextCell::New(name, strlen(name));
                if (!name) value.CleanUp();
            }
            break;
        }
        case SV_Args: {
            ScriptVal list;
            list.m_Flags = type;
            list.m_Value.m_Args = {};
            if (data) {
                list.m_Value.m_Args.m_Table =
                    static_cast<const ScriptVal::ArgsPayload*>(data)->m_Table;
            }
            CopyInto(value, list);
            list.m_Flags = SV_Nil;
            if (value.IsArgs()) value.m_Flags = type;
            break;
        }
        case SV_RemoteObject: {
            if (!data) break;
            RemoteObject* object = nullptr;
            read(object);
            value.m_Flags = object ? type : SVF_KeptNil;
            payload.m_RemoteObject = object;
            if (object) g_ScriptHooks.m_IncRemoteRef(object);
            break;
        }
        case SV_LocalObject: {
            ScriptObject* object = nullptr;
            if (data) read(object);
            uint64_t ref = ObjectReferences::AddObjectReference(object);
            if (object && !ref) break;  // no memory
            value.m_Flags = object ? type : SVF_KeptNil;
            payload.m_LocalObject = {object, ref};
            if (object && !(type & SVF_Foreign)) object->IncRef();
            break;
        }
        case SV_Code: {
            ScriptVal::BlockPayload code{};
            if (data) read(code);
            if (!CopyBlock(payload.m_Code.m_Ptr, code.m_Ptr, code.m_Size)) break;
            value.m_Flags = type;
            payload.m_Code.m_Size = code.m_Size;
            payload.m_Code.m_Args = code.m_Args;
            break;
        }
        case SV_MemBlock: {
            if (!data) break;
            MemBlock block;
            read(block);
            if (!CopyBlock(payload.m_MemBlock.m_Ptr, block.m_Ptr, block.m_Size)) break;
            value.m_Flags = type;
            payload.m_MemBlock.m_Size = block.m_Size;
            break;
        }
        default:
            break;
    }
}

// Releases a payload other than the chain of a list.
void ReleaseShallow(uint32_t flags, const ScriptVal::Payload& payload) {
    switch (flags & SVF_TypeMask) {
        case SV_String:
            TextCell::Drop(payload.m_String.m_String);
            break;
        case SV_Table:
            TextCell::Drop(payload.m_Table.m_Constructor);
            break;
        case SV_Args:
            if (payload.m_Args.m_App) g_ScriptHooks.m_RecycleApp(payload.m_Args.m_App);
            break;
        case SV_RemoteObject:
            g_ScriptHooks.m_DecRemoteRef(payload.m_RemoteObject);
            break;
        case SV_LocalObject:
            if (!(flags & SVF_Foreign) && IsAlive(payload))
                payload.m_LocalObject.m_Object->DecRef();
            break;
        case SV_Code:
        case SV_MemBlock:
            g_ReusePoolMgr.Free(payload.m_MemBlock.m_Ptr);
            break;
        default:
            break;
    }
}

// Makes a value with a payload nil. When it is a list with a chain, that is given to the caller and
// the value is to be looked at again after it: an args list lets go of its connection last.
TableEntry* ReleaseUpToChain(ScriptVal& value) {
    uint32_t flags = value.m_Flags;
    TableEntry* chain = nullptr;
    if (Chain::IsList(value)) chain = std::exchange(value.m_Value.m_Table.m_Table, nullptr);
    if (chain && value.IsArgs()) return chain;
    value.m_Flags = SV_Nil;
    ReleaseShallow(flags, value.m_Value);
    return chain;
}

}  // namespace

constinit const ScriptVal& ScriptVal::nil = s_Nil.m_Value;

ScriptVal& InvalidValue() {
    // More than once where host code that runs for an object writes to it.
    while (t_Invalid.KeepMe()) t_Invalid.CleanUp();
    return t_Invalid;
}

bool IsInvalid(const ScriptVal& value) {
    return &value == &t_Invalid;
}

void ReleaseChain(TableEntry* entry) {
    // The entries on the way down from the first chain: each is out of its chain but for its next
    // link, and its value, which is nil by then or a list without a chain, keeps the way up.
    TableEntry* parent = nullptr;
    for (;;) {
        while (entry) {
            TableEntry* inner = nullptr;
            if (entry->m_Value.HasPayload()) inner = ReleaseUpToChain(entry->m_Value);
            if (!inner && entry->m_Key.HasPayload()) inner = ReleaseUpToChain(entry->m_Key);
            if (inner) {
                entry->m_Value.m_Value.m_Table.m_Table = parent;
                parent = entry;
                entry = inner;
            } else {
                TableEntry* next = entry->m_Next;
                FreeEntry(entry);
                entry = next;
            }
        }
        if (!parent) return;
        entry = parent;
        parent = std::exchange(entry->m_Value.m_Value.m_Table.m_Table, nullptr);
    }
}

void ScriptVal::Release(uint32_t flags, const Payload& payload) {
    switch (flags & SVF_TypeMask) {
        case SV_Table:
            TextCell::Drop(payload.m_Table.m_Constructor);
            ReleaseChain(payload.m_Table.m_Table);
            break;
        case SV_Args: {
            // Host code runs for the chain, and may fill the value anew.
            RemoteApp* app = payload.m_Args.m_App;
            ReleaseChain(payload.m_Args.m_Table);
            if (app) g_ScriptHooks.m_RecycleApp(app);
            break;
        }
        default:
            ReleaseShallow(flags, payload);
    }
}

void ScriptVal::CopyPayload(const ScriptVal& other) {
    m_Flags = SV_Nil;
    CopyInto(*this, other);
}

ScriptVal& ScriptVal::CopyFrom(const ScriptVal& other) {
    bool isSameRemote = IsRemoteObject() && other.IsRemoteObject() &&
                        m_Value.m_RemoteObject == other.m_Value.m_RemoteObject;
    if (IsReadOnly() || this == &other || isSameRemote) return *this;
    return *this = ScriptVal(other);
}

ScriptVal& ScriptVal::MoveFrom(ScriptVal& other) {
    if (this == &other) return *this;
    uint32_t oldFlags = m_Flags;
    Payload old = m_Value;
    Take(other);
    Release(oldFlags, old);
    return *this;
}

ScriptVal& ScriptVal::ReplacePayload(uint32_t flags, uint64_t word) {
    ScriptVal scalar;
    scalar.m_Flags = flags;
    scalar.m_Value.m_Word = word;
    return MoveFrom(scalar);
}

void ScriptVal::Set(ScriptValType type, const void* data) {
    if ((type & SVF_TypeMask) == SV_RemoteObject && IsRemoteObject() && data &&
        memcmp(data, &m_Value.m_RemoteObject, sizeof(RemoteObject*)) == 0) {
        return;
    }
    if (IsReadOnly() || data == &m_Value) return;
    ScriptVal made;
    Make(made, type, data);
    *this = std::move(made);
}

void ScriptVal::Set(ScriptValType type, const char* const* text, int length) {
    if (IsReadOnly()) return;
    ScriptVal made;
    if ((type & SVF_TypeMask) == SV_String && text && *text) {
        size_t size = length > 0 ? static_cast<size_t>(length) : 0;
        char* cell = TextCell::New(*text, size);
        if (cell) {
            cell[1] = TextCell::SafeFirstByte(cell[1]);
            AdoptText(made, type, cell, strlen(cell + 1));
        }
    }
    *this = std::move(made);
}

ScriptVal::ScriptVal(const void* code, uint32_t size, uint32_t args) : ScriptVal() {
    BlockPayload block{const_cast<void*>(code), size, args};
    Set(SV_Code, &block);
}

void ScriptVal::CleanUp() {
    if (HasPayload()) {
        ReleasePayload();
    } else {
        m_Flags = SV_Nil;
    }
}

ScriptVal ScriptVal::CreateUUID() {
    ScriptVal value;
    CreateUUID(value);
    return value;
}

void ScriptVal::CreateUUID(ScriptVal& value) {
    char* uuid = Platform::NewUUID();
    value = uuid;
    Platform::DeleteUUID(uuid);
}

bool ScriptVal::IsLocalObject(bool strict) const {
    if (Is(SV_LocalObject)) return true;
    return !strict && IsRemoteObject() && g_ScriptHooks.m_GetLocalPointer(m_Value.m_RemoteObject);
}

bool ScriptVal::IsValidRemoteObject() const {
    RemoteApp* app = IsRemoteObject() ? GetApp() : nullptr;
    return app && g_ScriptHooks.m_IsConnected(app);
}

const void* ScriptVal::GetData() const {
    if (IsNull(this) || (Is(SV_LocalObject) && !IsAlive(m_Value))) return nullptr;
    return &m_Value;
}

bool ScriptVal::Get(ScriptValType type, void* out) const {
    auto write = [out](const auto& field) {
        memcpy(out, &field, sizeof field);
        return true;
    };
    if (type == SV_LocalObject) {
        if (!IsLocalObject(false)) return false;
        return write(ToLocalObject());
    }
    if (!Is(type)) return false;
    switch (type) {
        case SV_Number:
            return write(m_Value.m_Number);
        case SV_String:
            return write(ToString());
        case SV_Boolean:
            return write(m_Value.m_Boolean);
        case SV_Function:
        case SV_Pointer:
            return write(m_Value.m_Function);
        case SV_RemoteObject:
            return write(m_Value.m_RemoteObject);
        case SV_MemBlock:
            return write(ToMemBlock());
        default:
            return false;
    }
}

long long ScriptVal::ToInteger(long long def) const {
    return ToInt64(ToNumber(static_cast<double>(def)));
}

ScriptObject* ScriptVal::ToLocalObject(ScriptObject* def) const {
    if (Is(SV_LocalObject)) return IsAlive(m_Value) ? m_Value.m_LocalObject.m_Object : nullptr;
    if (!IsRemoteObject()) return def;
    ScriptObject* object = g_ScriptHooks.m_GetLocalPointer(m_Value.m_RemoteObject);
    return object ? object : def;
}

MemBlock ScriptVal::ToMemBlock() const {
    if (!IsMemBlock()) return {};
    return {m_Value.m_MemBlock.m_Ptr, m_Value.m_MemBlock.m_Size};
}

uint32_t ScriptVal::ToColor(uint32_t def) const {
    if (IsNumber()) return Low32(m_Value.m_Number);
    if (!IsTable()) return def;
    auto part = [this](const char* key, double missing) {
        return Low32(FindKeyConst(key).ToNumber(missing) * 255.0);
    };
    return part("R", 0) | part("G", 0) << 8 | part("B", 0) << 16 | part("A", 1) << 24;
}

template <>
bool ScriptVal::To(double& out, const char*) const {
    return Get(SV_Number, &out);
}
template <>
bool ScriptVal::To(float& out, const char*) const {
    if (IsNumber()) out = static_cast<float>(m_Value.m_Number);
    return IsNumber();
}
template <>
bool ScriptVal::To(int& out, const char*) const {
    if (!IsNumber()) return false;
    long long number = ToInteger();
    if (number > UINT32_MAX) number = INT32_MAX;
    if (number < INT32_MIN) number = INT32_MIN;
    out = static_cast<int>(number);
    return true;
}
template <>
bool ScriptVal::To(long long& out, const char*) const {
    if (IsNumber()) out = ToInteger();
    return IsNumber();
}
template <>
bool ScriptVal::To(unsigned long long& out, const char*) const {
    if (!IsNumber()) return false;
    double number = m_Value.m_Number;
    constexpr double k2To63 = 9223372036854775808.0;
    // The upper half of the range is out of reach for a signed number; negative ones keep their
    // bits.
    out = number < k2To63       ? static_cast<unsigned long long>(ToInteger())
          : number < 2 * k2To63 ? static_cast<unsigned long long>(number)
          : std::isnan(number)  ? 0
                                : UINT64_MAX;
    return true;
}
template <>
bool ScriptVal::To(bool& out, const char*) const {
    return Get(SV_Boolean, &out);
}
template <>
bool ScriptVal::To(void*& out, const char*) const {
    return Get(SV_Pointer, &out);
}
template <>
bool ScriptVal::To(std::string& out, const char*) const {
    if (!IsString()) return false;
    try {
        out = ToString();
    } catch (const std::bad_alloc&) {
        return false;
    }
    return true;
}

template <>
bool ScriptVal::From(const double& value, const char*) {
    return *this = value, true;
}
template <>
bool ScriptVal::From(const float& value, const char*) {
    return *this = value, true;
}
template <>
bool ScriptVal::From(const int& value, const char*) {
    return *this = value, true;
}
template <>
bool ScriptVal::From(const long long& value, const char*) {
    return *this = value, true;
}
template <>
bool ScriptVal::From(const unsigned long long& value, const char*) {
    return *this = value, true;
}
template <>
bool ScriptVal::From(const bool& value, const char*) {
    return *this = value, true;
}
template <>
bool ScriptVal::From(void* const& value, const char*) {
    return Set(SV_Pointer, &value), true;
}
template <>
bool ScriptVal::From(const std::string& value, const char*) {
    const char* text = value.c_str();
    // Not as a plain text, which might begin like a cell.
    Set(SV_String, &text, static_cast<int>(strnlen(text, INT32_MAX)));
    return true;
}

}  // namespace Korvel

// The wire form of values, and the packets of calls and of their replies.
#include <algorithm>
#include <bit>
#include <climits>
#include <cmath>
#include <cstring>
#include <limits>
#include <string_view>
#include <utility>

#include "core/ScriptHooksInternal.h"
#include "core/ScriptValInternal.h"
#include "objects/ScriptObject.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"
#include "remote/RemoteObject.h"
#include "remote/ScriptPort.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

static_assert(std::endian::native == std::endian::little);

constexpr uint32_t kUUIDLength = 36;
constexpr uint32_t kMinEntrySize = 8;  // two nils

// The flags that a value of each type may bring along. The others are of this process alone.
constexpr uint32_t kReceivedFlags[SV_Pointer + 1] = {
    SVF_KeptNil,                                    // SV_Nil
    SVF_Int,                                        // SV_Number
    0,                                              // SV_String
    0,                                              // SV_Boolean
    ~(SVF_TypeMask | SVF_ReadOnly | SVF_FromWire),  // SV_Table
    SVF_TableResult | SVF_AnyThreadFunc,            // SV_Function
};

// Adds the bytes that a value takes which has `depth` lists around it. False when lists nest too
// deeply.
bool Measure(const ScriptVal& value, int depth, uint64_t& size);

bool MeasureEntries(const ScriptVal& list, int depth, uint64_t& size) {
    if (depth >= kMaxNesting) return false;
    uint64_t sum = 0;  // in a register
    auto add = [&sum, depth](const ScriptVal& value) {
        if (value.IsNumber()) return sum += 12, true;
        return Measure(value, depth + 1, sum);
    };
    for (const TableEntry* entry = Chain::Head(list); entry; entry = entry->m_Next) {
        if (!add(entry->m_Key) || !add(entry->m_Value)) return false;
    }
    size += sum;
    return true;
}

bool Measure(const ScriptVal& value, int depth, uint64_t& size) {
    switch (value.Type()) {
        case SV_Number:
        case SV_Function:
        case SV_Pointer:
            size += 12;
            return true;
        case SV_String:
            size += strlen(value.ToString()) + 5;
            return true;
        case SV_Boolean:
            size += 5;
            return true;
        case SV_Table: {
            const char* constructor = value.GetConstructor();
            size += 9 + (constructor ? strlen(constructor) : 0);
            return MeasureEntries(value, depth, size);
        }
        case SV_Args:
            size += 8;
            return MeasureEntries(value, depth, size);
        case SV_RemoteObject:
        case SV_LocalObject:
            size += 8 + kUUIDLength;
            return true;
        case SV_Code:
            size += 8 + uint64_t{value.ToCodeLen()};
            return true;
        case SV_MemBlock:
            size += 8 + uint64_t{value.m_Value.m_MemBlock.m_Size};
            return true;
        default:
            size += 4;
            return true;
    }
}

template <class T>
unsigned char* Put(unsigned char* at, const T& field) {
    memcpy(at, &field, sizeof field);
    return at + sizeof field;
}

unsigned char* PutText(unsigned char* at, const char* text) {
    return reinterpret_cast<unsigned char*>(stpcpy(reinterpret_cast<char*>(at), text)) + 1;
}

unsigned char* PutBlock(unsigned char* at, const void* block, uint32_t size) {
    at = Put(at, size);
    if (size) memcpy(at, block, size);
    return at + size;
}

unsigned char* PutObject(unsigned char* at, uint32_t id, const ScriptVal& uuid) {
    at = Put(at, id);
    const char* text = uuid.ToString("");
    if (strlen(text) == kUUIDLength) {
        memcpy(at, text, kUUIDLength);
    } else {
        memset(at, 0, kUUIDLength);
    }
    return at + kUUIDLength;
}

// Writes into room that has been measured. All of it takes the place to write to and returns the
// place behind, so that it stays in a register.
class Writer {
public:
    Writer(RemoteApp* app, uint16_t run) : m_App(app), m_Run(run) {}

    unsigned char* Write(unsigned char* at, const ScriptVal& value) const {
        if (!value.IsNumber()) return WriteOther(at, value);
        at = Put(at, value.m_Flags & ~SVF_ReadOnly);
        return Put(at, value.m_Value.m_Number);
    }

private:
    unsigned char* WriteOther(unsigned char* at, const ScriptVal& value) const;
    unsigned char* WriteEntries(unsigned char* at, const ScriptVal& list) const;
    uint32_t NumberOfProxy(const RemoteObject& proxy) const;
    uint32_t Export(const ScriptVal& value) const;

    RemoteApp* const m_App;
    const uint16_t m_Run;  // 0 for any
};

unsigned char* Writer::WriteEntries(unsigned char* at, const ScriptVal& list) const {
    unsigned char* countAt = at;
    uint32_t count = 0;
    at += sizeof count;
    for (const TableEntry* entry = Chain::Head(list); entry; entry = entry->m_Next) {
        at = Write(at, entry->m_Key);
        at = Write(at, entry->m_Value);
        count++;
    }
    Put(countAt, count);
    return at;
}

unsigned char* Writer::WriteOther(unsigned char* at, const ScriptVal& value) const {
    const ScriptVal::Payload& payload = value.m_Value;
    uint32_t hidden = value.IsCode() ? SVF_ReadOnly | SVF_ForeignCode : SVF_ReadOnly;
    at = Put(at, value.m_Flags & ~hidden);
    switch (value.Type()) {
        case SV_String:
            return PutText(at, value.ToString());
        case SV_Boolean:
            return Put(at, static_cast<unsigned char>(payload.m_Boolean));
        case SV_Table: {
            const char* constructor = value.GetConstructor();
            return WriteEntries(PutText(at, constructor ? constructor : ""), value);
        }
        case SV_Args:
            return WriteEntries(at, value);
        case SV_Function:
        case SV_Pointer:
            return Put(at, payload.m_Word);
        case SV_RemoteObject: {
            const RemoteObject& proxy = *payload.m_RemoteObject;
            ScriptVal uuid = proxy.m_App ? proxy.m_App->GetUUID() : ScriptVal();
            return PutObject(at, NumberOfProxy(proxy), uuid);
        }
        case SV_LocalObject:
            return PutObject(at, Export(value), GetAppUUID());
        case SV_Code:
            return PutBlock(at, payload.m_Code.m_Ptr, payload.m_Code.m_Size);
        case SV_MemBlock:
            return PutBlock(at, payload.m_MemBlock.m_Ptr, payload.m_MemBlock.m_Size);
        default:
            return at;
    }
}

// A proxy has a meaning for its owner alone.
uint32_t Writer::NumberOfProxy(const RemoteObject& proxy) const {
    bool isAtHome = m_App && proxy.m_App == m_App && m_App->Connected();
    return isAtHome ? m_App->NumberOf(proxy) : kNoID;
}

// Counts an object for the peer.
uint32_t Writer::Export(const ScriptVal& value) const {
    ScriptObject* object = value.ToLocalObject();
    if (!m_App || !object || (value.m_Flags & SVF_Foreign)) return kNoID;
    uint32_t id = m_App->Export(object, m_Run);
    return id ? id : kNoID;
}

// Reads bytes of a peer. Nothing that it says is taken for granted; it recurses as deep as lists
// may nest. All of it takes the place to read from, which is not past the end, and returns the
// place behind, or null: then the values hold what has been read, fit to be released.
class Reader {
public:
    using Place = const unsigned char*;

    Reader(RemoteApp* app, uint16_t run, Place end) : m_App(app), m_Run(run), m_End(end) {}

    // Fills a nil that has `depth` lists around it.
    [[nodiscard]] Place Read(Place at, ScriptVal& value, int depth) const {
        if (Left(at) < kNumberSize || !IsNumber(at)) return ReadOther(at, value, depth);
        return GetNumber(at, value);
    }

private:
    static constexpr size_t kNumberSize = 12;

    size_t Left(Place at) const { return static_cast<size_t>(m_End - at); }

    static bool IsNumber(Place at) { return *at == SV_Number; }
    static Place GetNumber(Place at, ScriptVal& value) {
        uint32_t word;
        double number;
        memcpy(&word, at, sizeof word);
        memcpy(&number, at + sizeof word, sizeof number);
        // LuaJIT keeps its own pointers in NaNs, and scripts read numbers where they lie.
        if (std::isnan(number)) [[unlikely]]
            number = std::numeric_limits<double>::quiet_NaN();
        value.m_Flags = word & (SVF_TypeMask | SVF_Int);
        value.m_Value.m_Number = number;
        return at + kNumberSize;
    }

    template <class T>
    [[nodiscard]] Place Get(Place at, T& field) const {
        if (Left(at) < sizeof field) return nullptr;
        memcpy(&field, at, sizeof field);
        return at + sizeof field;
    }
    Place GetText(Place at, std::string_view& text) const;
    Place GetBlock(Place at, MemBlock& block) const;
    Place ReadOther(Place at, ScriptVal& value, int depth) const;
    Place ReadText(Place at, ScriptVal& value) const;
    Place ReadConstructor(Place at, ScriptVal& table) const;
    Place ReadEntries(Place at, ScriptVal& list, int depth) const;
    Place ReadCode(Place at, ScriptVal& value) const;
    Place ReadMemBlock(Place at, ScriptVal& value) const;
    Place ReadObject(Place at, ScriptVal& value, bool isOurs) const;
    void FindOurs(ScriptVal& value, uint32_t id) const;
    void MakeProxy(ScriptVal& value, uint32_t id) const;
    bool IsInProcess() const { return m_App && m_App->GetSocket() == kInProcess; }

    RemoteApp* const m_App;
    const uint16_t m_Run;  // 0 for any
    const Place m_End;
};

Reader::Place Reader::ReadOther(Place at, ScriptVal& value, int depth) const {
    uint32_t word;
    at = Get(at, word);
    if (!at) return nullptr;
    uint32_t type = word & SVF_TypeMask;
    if (type > SV_Pointer) return nullptr;
    uint32_t flags = word & kReceivedFlags[type];
    switch (type) {
        case SV_Nil:
            value.m_Flags = SV_Nil | flags;
            return at;
        case SV_String:
            return ReadText(at, value);
        case SV_Boolean: {
            unsigned char byte;
            at = Get(at, byte);
            if (at) value = byte != 0;
            return at;
        }
        case SV_Table:
            value.m_Flags = SV_Table | flags;
            value.m_Value.m_Table = {};
            at = ReadConstructor(at, value);
            return at ? ReadEntries(at, value, depth) : nullptr;
        case SV_Args:
            value.m_Flags = SV_Args;
            value.m_Value.m_Args = {};
            return ReadEntries(at, value, depth);
        case SV_Function:
        case SV_Pointer: {
            uint64_t address;
            at = Get(at, address);
            if (!at) return nullptr;
            value.m_Flags = type | flags;
            value.m_Value.m_Word = address;
            return at;
        }
        case SV_RemoteObject:
        case SV_LocalObject:
            return ReadObject(at, value, type == SV_RemoteObject);
        case SV_Code:
            return ReadCode(at, value);
        case SV_MemBlock:
            return ReadMemBlock(at, value);
        case SV_Ref:
            return at;
        default:
            return nullptr;  // a number that has been cut off
    }
}

// A text that stands in the packet with its NUL. None may look like a cell.
Reader::Place Reader::GetText(Place at, std::string_view& text) const {
    auto end = static_cast<Place>(memchr(at, 0, Left(at)));
    if (!end || *at == static_cast<unsigned char>(TextCell::kMarker)) return nullptr;
    text = {reinterpret_cast<const char*>(at), static_cast<size_t>(end - at)};
    return end + 1;
}

Reader::Place Reader::ReadText(Place at, ScriptVal& value) const {
    std::string_view text;
    at = GetText(at, text);
    const char* cell = at ? TextCell::New(text.data(), text.size()) : nullptr;
    if (!cell) return nullptr;
    AdoptText(value, SV_String, cell, text.size());
    return at;
}

Reader::Place Reader::ReadConstructor(Place at, ScriptVal& table) const {
    std::string_view text;
    at = GetText(at, text);
    if (!at || text.empty()) return at;
    table.m_Value.m_Table.m_Constructor = TextCell::New(text.data(), text.size());
    return table.GetConstructor() ? at : nullptr;
}

Reader::Place Reader::ReadEntries(Place at, ScriptVal& list, int depth) const {
    uint32_t count;
    at = Get(at, count);
    if (!at || count > Left(at) / kMinEntrySize || depth >= kMaxNesting) return nullptr;
    // The chain is linked as it grows, so that it is released wherever this ends.
    TableEntry** link = &list.m_Value.m_Table.m_Table;
    TableEntry* last = nullptr;
    bool isAscending = true;
    double greatest = -HUGE_VAL;
    for (; count > 0; count--) {
        TableEntry* entry = NewEntry();
        if (!entry) return nullptr;
        last = *link = entry;
        link = &entry->m_Next;
        if (Left(at) >= 2 * kNumberSize && IsNumber(at) && IsNumber(at + kNumberSize)) [[likely]] {
            at = GetNumber(GetNumber(at, entry->m_Key), entry->m_Value);
        } else {
            at = Read(at, entry->m_Key, depth + 1);
            if (at) at = Read(at, entry->m_Value, depth + 1);
            if (!at) return nullptr;
            if (!entry->m_Key.IsNumber()) continue;
        }
        double number = entry->m_Key.m_Value.m_Number;
        if (number > greatest) [[likely]] {
            greatest = number;
        } else if (number < greatest) {
            isAscending = false;
        }
    }
    if (!isAscending) {
        ScriptVal table(SV_Table, nullptr);
        table.SetTable(std::exchange(list.m_Value.m_Table.m_Table, nullptr));
        last = table.m_Value.m_Table.m_Last;
        list.m_Value.m_Table.m_Table = table.TakeTable();
    }
    if (list.IsTable()) list.m_Value.m_Table.m_Last = last;
    return at;
}

// A view of bytes in the packet.
Reader::Place Reader::GetBlock(Place at, MemBlock& block) const {
    uint32_t size;
    at = Get(at, size);
    if (!at || Left(at) < size) return nullptr;
    block = MemBlock(const_cast<unsigned char*>(at), size);
    return at + size;
}

Reader::Place Reader::ReadCode(Place at, ScriptVal& value) const {
    MemBlock code;
    at = GetBlock(at, code);
    if (!at) return nullptr;
    value = ScriptVal(code.m_Ptr, code.m_Size, 0);
    if (!value.IsCode()) return nullptr;
    if (!IsInProcess()) value.m_Flags |= SVF_ForeignCode;
    return at;
}

Reader::Place Reader::ReadMemBlock(Place at, ScriptVal& value) const {
    MemBlock block;
    at = GetBlock(at, block);
    if (!at) return nullptr;
    value = block;
    return value.IsMemBlock() ? at : nullptr;
}

// What is local to one side is remote to the other. The UUID, which the peer may choose, says
// nothing that the connection does not know.
Reader::Place Reader::ReadObject(Place at, ScriptVal& value, bool isOurs) const {
    uint32_t id;
    at = Get(at, id);
    if (!at || Left(at) < kUUIDLength) return nullptr;
    if (m_App && isOurs) FindOurs(value, id);
    if (m_App && !isOurs) MakeProxy(value, id);
    return at + kUUIDLength;
}

void Reader::FindOurs(ScriptVal& value, uint32_t id) const {
    ScriptObject* object = m_App->HoldLocalObject(id);
    if (!object) return;
    uint64_t ref = ObjectReferences::AddObjectReference(object);
    if (!ref) return object->DecRef();
    value.m_Flags = SV_LocalObject;
    value.m_Value.m_LocalObject = {object, ref};  // with the count
}

void Reader::MakeProxy(ScriptVal& value, uint32_t id) const {
    RemoteObject* proxy = m_App->Import(id, m_Run);
    if (!proxy) return;
    value.m_Flags = SV_RemoteObject;
    value.m_Value.m_RemoteObject = proxy;
    if (!IsInProcess()) return;
    AutoAppLock guard(m_App->GetLock());
    proxy->m_Object = RemoteApp::GetObjectPtr(id);
}

// A table of values that are not copied: it borrows what they hold.
class ResultTable {
public:
    ResultTable() : m_Table(SV_Table, nullptr) {}
    ResultTable(const ResultTable&) = delete;
    ResultTable& operator=(const ResultTable&) = delete;
    ~ResultTable() {
        for (TableEntry* entry = Chain::Head(m_Table); entry; entry = entry->m_Next) {
            entry->m_Value.m_Flags = SV_Nil;
        }
    }

    // Number keys in ascending order. False without memory.
    [[nodiscard]] bool Borrow(ScriptVal key, const ScriptVal& value) {
        TableEntry* entry = key.IsNil() ? nullptr : NewEntry(std::move(key));
        if (!entry) return false;
        bool isDead = value.IsLocalObject(true) && !value.ToLocalObject();
        entry->m_Value.m_Flags = isDead ? SVF_KeptNil : value.m_Flags;
        if (!isDead) entry->m_Value.m_Value = value.m_Value;
        Chain::Append(m_Table, entry);
        return true;
    }

    [[nodiscard]] bool BorrowResults(const ScriptVal& args) {
        for (int i = args.IsArgs() ? args.m_Value.m_Args.m_NumReturns : 0; i > 0; i--) {
            if (!Borrow(-i, args.FindKeyConst(-i))) return false;
        }
        if (args.FindKeyConst("Error").IsNil()) return true;
        return Borrow("Error", args.FindKeyConst("Error")) &&
               Borrow("ErrorString", args.FindKeyConst("ErrorString"));
    }

    const ScriptVal& Get() const { return m_Table; }

private:
    ScriptVal m_Table;
};

bool IsTraced(RemoteApp* app, const ScriptVal& args) {
    return (app && (app->GetFlags() & PKF_Trace)) || (args.m_Flags & SVF_FromWire);
}

// Whole milliseconds.
uint32_t DelayOf(const ScriptVal& args) {
    long long delay = args.FindKeyConst("__delay").ToInteger();
    return static_cast<uint32_t>(std::clamp<long long>(delay, 0, UINT32_MAX));
}

bool SendReply(ScriptArgs& args) {
    RemoteApp* app = args.GetApp();
    uint16_t run = args.m_Value.m_Args.m_Run;
    if (run && app->GetRun() != run) return false;  // who has asked is gone
    Packet* reply = ScriptVal::ToReply(app, args.m_Value.m_Args.m_Context, nullptr, &args);
    if (!reply) return false;
    app->SendPkt(reply);
    return true;
}

[[maybe_unused]] const bool s_IsHooked = (g_ScriptHooks.m_SendReply = SendReply, true);

bool ReadValue(ScriptVal& value, RemoteApp* app, uint16_t run, unsigned char*& cursor,
               const unsigned char* end) {
    ScriptVal read;
    const unsigned char* behind = Reader(app, run, end).Read(cursor, read, 0);
    if (behind) {
        cursor += behind - cursor;
    } else {
        read.CleanUp();
    }
    value = std::move(read);
    return behind;
}

}  // namespace

void RemoteApp::KeepError(const ScriptVal& results) {
    const ScriptVal& error = results.FindKeyConst("Error");
    if (error.ToNumber() == 0) return;
    // A number that is none of ours is no less an error.
    long long number = error.ToInteger();
    if (number <= 0 || number > INT_MAX) number = SCERR_Unknown;
    SetLastError(static_cast<uint32_t>(number), results.FindKeyConst("ErrorString").ToString(""));
}

uint32_t ScriptVal::CalcPktSize() const {
    uint64_t size = 0;
    bool fits = Measure(*this, 0, size) && size <= UINT32_MAX;
    return fits ? static_cast<uint32_t>(size) : 0;
}

bool ScriptVal::ToPkt(RemoteApp* app, unsigned char*& cursor) const {
    cursor = Writer(app, 0).Write(cursor, *this);
    return true;
}

bool ScriptVal::FromPkt(RemoteApp* app, unsigned char*& cursor, const unsigned char* end) {
    return ReadValue(*this, app, 0, cursor, end);
}

void WriteValues(Packet* packet, RemoteApp* app, const ScriptVal& first, const ScriptVal& second) {
    Writer writer(app, static_cast<uint16_t>(packet->m_Reserved));
    writer.Write(writer.Write(packet->Payload(), first), second);
}

Packet* ScriptVal::ToPacket(RemoteApp* app, uint32_t target, int symbol, const ScriptVal* first,
                            const ScriptVal* second) {
    Packet* packet = CreatePkt(PKT_Script, app, first, second);
    if (!packet) return nullptr;
    packet->m_Symbol = static_cast<uint32_t>(symbol);
    packet->m_Target = target;
    if (second && (second->m_Flags & SVF_FromWire)) packet->m_Flags |= PKF_Trace;
    return packet;
}

Packet* ScriptVal::ToPacket(RemoteObject* object, int symbol, const ScriptVal* first,
                            const ScriptVal* second) {
    if (!object) return nullptr;
    uint32_t target = object->m_App ? object->m_App->NumberOf(*object) : object->m_ID;
    return ToPacket(object->m_App, target, symbol, first, second);
}

Packet* ScriptVal::ToReply(RemoteApp* app, uint32_t context, const ScriptVal* first,
                           ScriptVal* args) {
    uint16_t run = args && args->IsArgs() ? args->m_Value.m_Args.m_Run : uint16_t{0};
    ResultTable result;
    if (!args) return CreateReplyOrError(context, app, run, first, &result.Get());
    if (!result.BorrowResults(*args)) return nullptr;
    if (IsTraced(app, *args)) TraceValues("<-", context, result.Get());
    Packet* reply = CreateReplyOrError(context, app, run, first, &result.Get());
    if (!reply) return nullptr;
    if (args->m_Flags & SVF_FromWire) reply->m_Flags |= PKF_Trace;
    reply->m_Delay = DelayOf(*args);
    return reply;
}

Packet* ScriptVal::ToReply(RemoteObject* object, Packet* request, const ScriptVal* first,
                           ScriptVal* args) {
    return ToReply(object ? object->m_App : nullptr, request->m_Context, first, args);
}

bool ScriptVal::FromPacket(RemoteApp* app, Packet* packet, ScriptVal* first, ScriptVal* second) {
    if (packet->m_Size < kMinPacketSize) return false;
    unsigned char* cursor = packet->Payload();
    const unsigned char* end = packet->End();
    ScriptVal a, b;
    auto run = static_cast<uint16_t>(packet->m_Reserved);
    bool isValid = ReadValue(a, app, run, cursor, end) && ReadValue(b, app, run, cursor, end);
    if (!isValid || cursor != end) return false;
    if (packet->m_Type == PKT_Reply && app && second && b.IsTable()) app->KeepError(b);
    if (packet->m_Flags & PKF_Trace) b.m_Flags |= SVF_FromWire;
    if (first) *first = std::move(a);
    if (second) {
        if (second->IsArgs() && b.IsArgs()) {
            b.m_Value.m_Args.m_Context = second->m_Value.m_Args.m_Context;
        }
        *second = std::move(b);
    }
    return true;
}

bool ScriptVal::FromPacket(RemoteObject* object, Packet* packet, ScriptVal* first,
                           ScriptVal* second) {
    return FromPacket(object ? object->m_App : nullptr, packet, first, second);
}

}  // namespace Korvel

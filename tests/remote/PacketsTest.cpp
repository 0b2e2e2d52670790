// The wire form of values as bytes, what is refused, and how objects are counted across it.
#include "remote/Packets.h"

#include <gtest/gtest.h>

#include <climits>
#include <cstdlib>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "../core/ScriptValFakes.h"
#include "core/FaultsInternal.h"
#include "diag/Env.h"
#include "objects/ScriptSymbol.h"
#include "remote/RemoteObject.h"
#include "remote/ScriptPort.h"

namespace Korvel {
namespace {

using namespace std::string_literals;
using Test::Describe;
using Test::FakeObject;
using Test::MakeTable;
using PacketPtr = std::unique_ptr<Packet, decltype(&FreePkt)>;

const std::string kPeerUUID = "aaaaaaaa-bbbb-4ccc-8ddd-eeeeeeeeeeee";

// A connection that says it is connected.
class FakeApp : public RemoteApp {
public:
    FakeApp() : RemoteApp("fake", 0, nullptr) {}

    bool Connected() const override { return m_IsConnected; }
    Platform::_Socket* GetSocket() const override { return m_Socket; }
    ScriptVal GetUUID() const override { return kPeerUUID.c_str(); }
    uint32_t SendPkt(Packet* packet) override { return m_Sent.reset(packet), packet->m_Context; }

    // Proxies of the small numbers that tests use, and of what cannot be named.
    int CountProxies() {
        int count = !FindRemoteObject(UINT_MAX).IsNil();
        for (int id = 2; id < 100; id++) count += !FindRemoteObject(id).IsNil();
        return count;
    }

    bool m_IsConnected = true;
    Platform::_Socket* m_Socket = nullptr;
    PacketPtr m_Sent{nullptr, FreePkt};
};

template <class T>
std::string Bytes(T value) {
    return {reinterpret_cast<const char*>(&value), sizeof value};
}
std::string Word(uint32_t word) {
    return Bytes(word);
}
std::string Number(double number, uint32_t word = SV_Number | SVF_Int) {
    return Word(word) + Bytes(number);
}
std::string Object(ScriptValType type, uint32_t id, const std::string& uuid = kPeerUUID) {
    return Word(type) + Word(id) + uuid;
}

// Blocks of just the size, so that AddressSanitizer sees a step past them.
std::string Write(const ScriptVal& value, RemoteApp* app = nullptr) {
    std::vector<unsigned char> block(value.CalcPktSize());
    unsigned char* cursor = block.data();
    EXPECT_TRUE(value.ToPkt(app, cursor) && cursor == block.data() + block.size());
    return {block.begin(), block.end()};
}
bool Read(const std::string& bytes, ScriptVal& value, RemoteApp* app = nullptr) {
    std::vector<unsigned char> block(bytes.begin(), bytes.end());
    unsigned char* cursor = block.data();
    const unsigned char* end = cursor + block.size();
    return value.FromPkt(app, cursor, end) && cursor == end;
}
std::string Write(const PacketPtr& packet) {
    return {reinterpret_cast<char*>(packet.get()), packet->m_Size};
}
PacketPtr MakePacket(const std::string& payload) {
    uint32_t size = static_cast<uint32_t>(sizeof(Packet) + payload.size());
    PacketPtr packet(AllocPkt(size), FreePkt);
    *packet = {.m_Size = size,
               .m_Type = PKT_Script,
               .m_Symbol = SST_Sub,
               .m_Target = 3,
               .m_Context = 12,
               .m_Flags = 0,
               .m_Delay = 0,
               .m_Reserved = 0};
    std::copy(payload.begin(), payload.end(), packet->Payload());
    return packet;
}

ScriptVal NestTables(int depth) {
    ScriptVal value;
    for (; depth > 0; depth--) value = MakeTable({{1, value}});
    return value;
}

TEST(Wire, BytesThereAndBack) {
    ScriptVal named = MakeTable({{1, "x"}});
    named.SetConstructor("C");
    named.m_Flags |= SVF_Ordered | SVF_ReadOnly;
    uint64_t address = 0x1122334455667788;
    struct Case {
        ScriptVal value;
        std::string bytes;
    };
    const Case cases[] = {
        {ScriptVal(static_cast<ScriptObject*>(nullptr)), Word(0x100000)},
        {1, Number(1)},
        {1.5f, Number(1.5, 0x100001)},
        {"", Word(SV_String) + "\0"s},
        {"a\xFF", Word(SV_String) + "a\xFF\0"s},
        {true, Word(SV_Boolean) + "\1"},
        {MakeTable(), Word(SV_Table) + "\0"s + Word(0)},
        {named, Word(0x200004) + "C\0"s + Word(1) + Number(1) + Word(SV_String) + "x\0"s},
        {ScriptVal(SV_Function | 0x500000u, &address), Word(0x500005) + Bytes(address)},
        {ScriptVal(SV_Pointer, &address), Word(SV_Pointer) + Bytes(address)},
        {ScriptVal("\0c", 2, 3), Word(SV_Code) + Word(2) + "\0c"s},
        {MemBlock(const_cast<char*>("\xFFm"), 2), Word(SV_MemBlock) + Word(2) + "\xFFm"},
    };
    ScriptVal back, all(SV_Args, nullptr);
    for (const Case& c : cases) {
        EXPECT_EQ(Write(c.value), c.bytes) << Describe(c.value);
        EXPECT_TRUE(Read(c.bytes, back)) << Describe(c.value);
        EXPECT_EQ(Write(back), c.bytes) << Describe(c.value);
        all[c.bytes.c_str()] = c.value;
        for (size_t length = 0; length < c.bytes.size(); length++) {
            back = "old";
            EXPECT_FALSE(Read(c.bytes.substr(0, length), back)) << Describe(c.value) << length;
            EXPECT_TRUE(back.IsNil());
        }
    }
    // Damaged anywhere it is refused, or read as something that can be written and read again.
    std::mt19937 random(1);
    for (int i = 0; i < 10'000; i++) {
        std::string bytes = Write(all);
        for (int j = 0; j < 3; j++) bytes[random() % bytes.size()] = static_cast<char>(random());
        ScriptVal again;
        if (!Read(bytes, back)) continue;
        ASSERT_TRUE(Read(Write(back), again));
        ASSERT_EQ(Write(again), Write(back));
    }
}

TEST(Wire, WhatIsRefusedAndWhatIsMended) {
    const std::string args = Word(SV_Args), table = Word(SV_Table) + "\0"s;
    const std::string refused[] = {
        Word(13),
        Word(SV_String) + "\xFF\0"s,  // would be a cell
        Word(SV_Table) + "\xFF\0"s + Word(0),
        table + Word(2) + Word(0) + Word(0),  // fewer entries than counted
        args + Word(0xffffffff) + std::string(64, 0),
        Word(SV_Code) + Word(0xffffffff) + "code",
        args + Word(1) + Word(0) + Word(13),  // within
    };
    ScriptVal value;
    for (const std::string& bytes : refused) EXPECT_FALSE(Read(bytes, value)) << bytes;

    // Flags that mean something within a process are not taken from a peer; keys get in order.
    const uint32_t all = 0xffffff00;
    const std::pair<std::string, std::string> mended[] = {
        {Word(SV_Nil | all), "100000:nil"},
        {Number(2, SV_Number | all), "300001:2"},
        {Word(SV_String | all) + "s\0"s, "2:'s'"},
        {Word(SV_Boolean | all) + "\x80", "3:true"},
        {Word(SV_Table | all) + "\0"s + Word(0), "7ffffd04:{}"},
        {Word(SV_Function | all) + Bytes(uint64_t{16}), "500005:10"},
        {Word(SV_Code | all) + Word(1) + "c", "100008:[c]"},  // the mark of its origin
        {Word(SV_MemBlock | all) + Word(1) + "m", "9:[m]"},
        {Word(SV_Args | all) + Word(0), "a:{}"},
        {Word(SV_Ref | all), "0:nil"},
        {Word(SV_Pointer | all) + Bytes(uint64_t{16}), "c:10"},
        {Object(SV_RemoteObject, 1), "0:nil"},  // no connection
        {args + Word(2) + Number(1) + Word(0) + Number(-1) + Word(0),
         "a:{300001:-1=0:nil 300001:1=0:nil}"},
        {table + Word(3) + Number(2) + Word(0) + Number(NAN) + Word(0) + Number(1) + Word(0),
         "4:{300001:1=0:nil 300001:2=0:nil 300001:nan=0:nil}"},
    };
    for (const auto& [bytes, result] : mended) {
        EXPECT_TRUE(Read(bytes, value)) << result;
        EXPECT_EQ(Describe(value), result);
    }
    value[3] = "at the end";
    EXPECT_EQ(Describe(value, false), "{1=nil 2=nil nan=nil 3='at the end'}");
    // Bits of a NaN that an interpreter could take for a pointer.
    ASSERT_TRUE(Read(Word(SV_Number) + Bytes(uint64_t{0xfffb123456789abc}), value));
    EXPECT_EQ(std::bit_cast<uint64_t>(value.ToNumber()), 0x7ff8000000000000u);

    // Lists nest up to the limit, as values or as keys.
    std::string deepest = Write(NestTables(kMaxNesting)), keys;
    EXPECT_TRUE(Read(deepest, value));
    EXPECT_FALSE(Read(table + Word(1) + Number(1) + deepest, value));
    for (int i = 0; i < 100'000; i++) keys += args + Word(1);
    EXPECT_FALSE(Read(keys + std::string(1 << 20, 0), value));
    ScriptVal tooDeep = NestTables(kMaxNesting + 1);
    EXPECT_EQ(CreatePkt(PKT_Script, nullptr, nullptr, &tooDeep), nullptr);
}

TEST(Wire, ObjectsAreCountedAndSwapSides) {
    FakeApp app, other;
    FakeObject object;
    ScriptVal value(&object), back;
    const std::string ours = GetAppUUID().ToString("");
    RemoteObject* record = app._IncLocalRef(&object);
    const uint32_t id = record->m_ID;
    EXPECT_EQ(Write(value, &app), Object(SV_LocalObject, id, ours));
    EXPECT_EQ(record->m_Count, 2u);

    // It comes home as the object, with a count of the value's own.
    ASSERT_TRUE(Read(Object(SV_RemoteObject, id), back, &app));
    EXPECT_EQ(back.ToLocalObject(), &object);
    EXPECT_EQ(object.m_Uses, 3);
    ASSERT_TRUE(Read(Object(SV_RemoteObject, id), back, &other));  // never given to this peer
    EXPECT_EQ(Describe(back), "0:nil");
    EXPECT_EQ(object.m_Uses, 2);

    // An object of the peer is a proxy here, which has a name on its own connection alone.
    ASSERT_TRUE(Read(Object(SV_LocalObject, 5, std::string(36, 0)), back, &app));
    EXPECT_EQ(app.CountProxies(), 1);
    EXPECT_EQ(Write(back, &app), Object(SV_RemoteObject, 5));
    EXPECT_EQ(Write(back, &other), Object(SV_RemoteObject, UINT_MAX));
    ASSERT_TRUE(Read(Object(SV_LocalObject, 0), back, &app));
    EXPECT_EQ(Describe(back), "0:nil");
    EXPECT_EQ(app.CountProxies(), 0);

    // What cannot be named is not counted: without a connection, borrowed, dead, after the end.
    const std::string unnamed = Object(SV_LocalObject, UINT_MAX, ours);
    EXPECT_EQ(Write(value), unnamed);
    FakeObject* pointer = &object;
    EXPECT_EQ(Write(ScriptVal(SV_LocalObject | SVF_Foreign, &pointer), &app).substr(4),
              unnamed.substr(4));
    auto mortal = std::make_unique<FakeObject>();
    ScriptVal stale(mortal.get());
    mortal.reset();
    EXPECT_EQ(Write(stale, &app), unnamed);
    app.m_IsConnected = false;
    EXPECT_EQ(Write(value, &app), unnamed);
    EXPECT_EQ(record->m_Count, 2u);

    // Code is marked when it comes from another process.
    const std::string code = Word(SV_Code) + Word(1) + "c";
    ASSERT_TRUE(Read(code, value, &app));
    EXPECT_EQ(Describe(ScriptVal(value)), "100008:[c]");
    EXPECT_EQ(Write(value), code);
    app.m_Socket = kInProcess;
    ASSERT_TRUE(Read(code, value, &app));
    EXPECT_EQ(Describe(value), "8:[c]");

    // Within the process a proxy leads to the object, as long as the connection is that one.
    ASSERT_TRUE(Read(Object(SV_LocalObject, id), back, &app));
    EXPECT_TRUE(back.IsRemoteObject() && back.ToLocalObject() == &object);
    app.m_Socket = nullptr;
    EXPECT_EQ(back.ToLocalObject(), nullptr);
}

// What was counted before a packet proves malformed, or is read by nobody, goes back.
TEST(Packets, NothingThatIsDroppedStaysCounted) {
    FakeApp app;
    FakeObject object;
    const uint32_t id = app._IncLocalRef(&object)->m_ID;
    const std::string values = Object(SV_LocalObject, 5) + Word(SV_Table) + "\0"s + Word(1) +
                               Object(SV_RemoteObject, id) + Object(SV_LocalObject, 6);
    for (size_t length = 0; length <= values.size() + 1; length++) {
        PacketPtr packet = MakePacket((values + "?").substr(0, length));
        ScriptVal first = "as it was", second = first;
        bool isWhole = length == values.size();
        EXPECT_EQ(ScriptVal::FromPacket(&app, packet.get(), &first, &second), isWhole);
        EXPECT_EQ(object.m_Uses, 1 + isWhole);
        EXPECT_TRUE(isWhole || first == second);
        DropPkt(&app, packet.release());
    }
    EXPECT_EQ(object.m_Uses, 1);
    EXPECT_EQ(app.CountProxies(), 0);
}

TEST(Packets, Headers) {
    FakeApp app;
    PacketPtr packet(CreatePkt(PKT_NoMoreRefs, &app, nullptr, nullptr), FreePkt);
    EXPECT_EQ(Write(packet), Word(40) + Word(4) + std::string(32, 0));

    RemoteObject* proxy = app.IncRemoteRef(9);
    ScriptArgs args, read;
    args.SetPosition(0, "Name");
    app.SetFlags(PKF_Trace);
    packet.reset(ScriptVal::ToPacket(proxy, SST_GetTable, nullptr, &args));
    app.ClearFlags(PKF_Trace);
    EXPECT_EQ(Write(packet), Word(65) + Word(1) + Word(130) + Word(9) + Word(0) + Word(PKF_Trace) +
                                 Word(0) + Word(0) + Word(0) + Word(SV_Args) + Word(1) + Number(0) +
                                 Word(SV_String) + "Name\0"s);

    // A traced call has its mark from the packet, and its own calls keep it.
    read.m_Value.m_Args.m_Context = 77;
    ASSERT_TRUE(ScriptVal::FromPacket(proxy, packet.get(), nullptr, &read));
    EXPECT_EQ(read.m_Flags, SV_Args | SVF_FromWire);
    EXPECT_EQ(read.m_Value.m_Args.m_Context, 77u);
    packet.reset(ScriptVal::ToPacket(&app, 1, 1, nullptr, &read));
    EXPECT_EQ(packet->m_Flags, PKF_Trace);

    // The largest packet.
    std::vector<char> bytes(1 << 20);
    auto setLimit = [](const char* mib) {
        setenv("KORVEL_MaxPacketSize", mib, 1);
        EnvVar::InvalidateEnv();
        return GetMaxPacketSize() >> 20;
    };
    EXPECT_EQ(GetMaxPacketSize() >> 20, 256u);
    EXPECT_EQ(setLimit("4096"), 2047u);
    EXPECT_EQ(setLimit("0"), 1u);
    for (uint32_t spare : {44u, 43u}) {
        ScriptVal value(MemBlock(bytes.data(), (1 << 20) - spare));
        packet.reset(CreatePkt(PKT_Script, nullptr, nullptr, &value));
        EXPECT_EQ(packet != nullptr, spare == 44);
    }
    setLimit("256");
    proxy->DecRef();
}

TEST(Packets, RepliesTakeResultsAndErrors) {
    FakeApp app;
    ScriptArgs args;
    ScriptVal result;
    OxStringT<char> text;
    PacketPtr reply(nullptr, FreePkt);
    auto exchange = [&] {
        reply.reset(ScriptVal::ToReply(&app, 12, nullptr, &args));
        return reply && ScriptVal::FromPacket(&app, reply.get(), nullptr, &result);
    };
    args.SetPosition(1, "an argument");
    args.Return("first");
    {
        FakeObject mortal;
        args.ReturnObject(&mortal);
    }
    args[-1].m_Flags |= SVF_ReadOnly;
    args["__delay"] = 2500.9;
    ASSERT_TRUE(exchange());
    EXPECT_EQ(Write(reply).substr(4, 28),
              Word(PKT_Reply) + Word(0) + Word(0) + Word(12) + Word(0) + Word(2500) + Word(0));
    EXPECT_EQ(Describe(result), "4:{300001:-2=100000:nil 300001:-1=2:'first'}");
    EXPECT_EQ(Describe(args[-1]), "202:'first'");  // was lent

    struct Case {
        ScriptVal error, text;
        uint32_t number;
        const char* kept;
    };
    const Case cases[] = {
        {0, "none", 0, ""}, {"text", "none", 0, ""}, {9, "Unknown Symbol.", 9, "Unknown Symbol."},
        {9, 1, 9, ""},      {NAN, "odd", 1, "odd"},  {1e300, "odd", 1, "odd"},
    };
    for (const Case& c : cases) {
        args["Error"] = c.error;
        args["ErrorString"] = c.text;
        ASSERT_TRUE(exchange());
        EXPECT_EQ(app.TakeLastError(text), c.number);
        EXPECT_TRUE(!c.number || text == c.kept);
    }
    for (const auto& [delay, ms] : {std::pair(-1.0, 0u), {NAN, 0u}, {1e30, UINT_MAX}}) {
        args["__delay"] = delay;
        ASSERT_TRUE(exchange());
        EXPECT_EQ(reply->m_Delay, ms);
    }
    // Who waits for results that do not fit hears of it.
    args[-1] = SV_Nil;
    args[-2] = NestTables(kMaxNesting);
    ASSERT_TRUE(exchange());
    EXPECT_EQ(Describe(result, false), "{'Error'=1 'ErrorString'='Packet too large.'}");
}

TEST(Packets, DeferredRepliesAndTraces) {
    FakeApp app;
    ScriptArgs args;
    EXPECT_FALSE(args.SendReply());
    args.SetApp(&app);
    EXPECT_EQ(args.DeferReply(), nullptr);  // nobody waits
    args.m_Value.m_Args.m_Context = 6;
    args.m_Flags |= SVF_FromWire;
    args.Return(5);
    std::unique_ptr<ScriptArgs> deferred(args.DeferReply());
    ASSERT_TRUE(deferred);
    EXPECT_TRUE(args.IsEmpty() && (args.m_Flags & SVF_ReplyDeferred));
    EXPECT_EQ(app.GetUseCount(), 3u);

    testing::internal::CaptureStdout();
    EXPECT_TRUE(deferred->SendReply());
    DumpPacket(app.m_Sent.get(), nullptr, "Send");
    PacketPtr packet = MakePacket("");
    DumpPacket(packet.get(), nullptr, "Recv");
    packet->m_Type = 11;
    DumpPacket(packet.get(), nullptr, "Recv");
    EXPECT_EQ(testing::internal::GetCapturedStdout(),
              "   <- [6] { [-1] = 5 }\n"
              "App (nil): Send ctx=6 tgt=0 PKT_Reply \n"
              "App (nil): Recv ctx=12 tgt=3 PKT_Script SST_Sub \n"
              "App (nil): Recv ctx=12 tgt=3 PKT_????? \n");
    EXPECT_EQ(app.m_Sent->m_Flags, PKF_Trace);
    deferred.reset();
    args.SetApp(nullptr);
    EXPECT_EQ(app.GetUseCount(), 1u);
}

#ifdef KORVEL_FAULTS
// Wherever memory runs out, nothing leaks and no count stays.
TEST(Packets, MemoryRunsOut) {
    FakeApp app;
    FakeObject object;
    ScriptArgs args;
    args.Return(&object);
    args.Return(MakeTable({{"key", "a text"}, {2, MakeTable({{1, 1}})}}));
    args.SetError(SCERR_Unknown);
    bool hasFailed = true;
    for (unsigned n = 1; hasFailed; n++) {
        Faults::FailAt(n, false);
        {
            PacketPtr reply(ScriptVal::ToReply(&app, 1, nullptr, &args), FreePkt);
            ScriptVal result;
            if (reply && ScriptVal::FromPacket(&app, reply.get(), nullptr, &result)) {
                EXPECT_TRUE(result["Error"] == 1);
            }
        }
        hasFailed = Faults::Stop() >= n;
        EXPECT_EQ(app.CountProxies(), 0);
    }
    EXPECT_EQ(object.m_Uses, 2) << "the arguments' and the connection's";
}
#endif

}  // namespace
}  // namespace Korvel

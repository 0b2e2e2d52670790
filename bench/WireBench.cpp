// The wire form of values beside CBOR by nlohmann and MessagePack by msgpack-c: nanoseconds for
// each number, or each entry, of a table that is written to a block of bytes and read from it. What
// is read is released outside of the time taken.
#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <functional>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "Compare.h"
#include "core/ScriptVal.h"
#include "remote/Packets.h"

#ifdef KORVEL_MSGPACK
#include <msgpack.h>
#endif

namespace {

using Korvel::ScriptVal;
using Json = nlohmann::json;

enum class Content { Numbers, Attributes };

std::string NameOf(int i) {
    static const char* const names[] = {"Name",   "Volume",   "Pan",   "Position", "IsMuted",
                                        "Colour", "Duration", "Owner", "Channel",  "FadeIn"};
    std::string name(names[i % 10]);
    return i < 10 ? name : name + std::to_string(i / 10);
}

struct Own {
    using Value = ScriptVal;
    static Value Make(Content content, int count) {
        Value table(Korvel::SV_Table, nullptr);
        for (int i = 0; i < count; i++) {
            if (content == Content::Numbers) {
                table.FindKey(i + 1, Korvel::SVF_Int, Korvel::SVF_Int) = i * 0.5;
            } else if (i % 3 == 0) {
                table.FindKey(NameOf(i).c_str()) = "a value of some length";
            } else {
                table.FindKey(NameOf(i).c_str()) = i * 0.5;
            }
        }
        return table;
    }
    using Bytes = Korvel::Packet*;
    static Bytes Write(const Value& value) {
        return Korvel::CreatePkt(Korvel::PKT_Script, nullptr, nullptr, &value);
    }
    static void Read(Value& value, Bytes packet) {
        if (!ScriptVal::FromPacket(static_cast<Korvel::RemoteApp*>(nullptr), packet, nullptr,
                                   &value)) {
            abort();
        }
    }
    static void Free(Bytes packet) { Korvel::FreePkt(packet); }
};

struct Nlohmann {
    using Value = Json;
    static Value Make(Content content, int count) {
        Value value = content == Content::Numbers ? Json::array() : Json::object();
        for (int i = 0; i < count; i++) {
            if (content == Content::Numbers) {
                value.push_back(i * 0.5);
            } else if (i % 3 == 0) {
                value[NameOf(i)] = "a value of some length";
            } else {
                value[NameOf(i)] = i * 0.5;
            }
        }
        return value;
    }
    using Bytes = std::vector<uint8_t>*;
    static Bytes Write(const Value& value) { return new auto(Json::to_cbor(value)); }
    static void Read(Value& value, Bytes bytes) { value = Json::from_cbor(*bytes); }
    static void Free(Bytes bytes) { delete bytes; }
};

#ifdef KORVEL_MSGPACK
// Its values are read-only and live in one zone with all that they hold.
struct MessagePack {
    struct Value {
        Value() { msgpack_unpacked_init(&m_Unpacked); }
        Value(const Value&) = delete;
        Value& operator=(const Value&) = delete;
        ~Value() { msgpack_unpacked_destroy(&m_Unpacked); }
        msgpack_unpacked m_Unpacked;
    };
    static std::unique_ptr<Value> Make(Content content, int count) {
        auto* buffer = msgpack_sbuffer_new();
        msgpack_packer packer;
        msgpack_packer_init(&packer, buffer, msgpack_sbuffer_write);
        if (content == Content::Numbers) {
            msgpack_pack_array(&packer, static_cast<size_t>(count));
        } else {
            msgpack_pack_map(&packer, static_cast<size_t>(count));
        }
        for (int i = 0; i < count; i++) {
            if (content == Content::Attributes) {
                std::string name = NameOf(i);
                msgpack_pack_str_with_body(&packer, name.data(), name.size());
            }
            if (content == Content::Attributes && i % 3 == 0) {
                msgpack_pack_str_with_body(&packer, "a value of some length", 22);
            } else {
                msgpack_pack_double(&packer, i * 0.5);
            }
        }
        auto value = std::make_unique<Value>();
        Read(*value, buffer);
        s_Kept.emplace_back(buffer, msgpack_sbuffer_free);
        return value;
    }
    using Bytes = msgpack_sbuffer*;
    static Bytes Write(const std::unique_ptr<Value>& value) {
        auto* buffer = msgpack_sbuffer_new();
        msgpack_packer packer;
        msgpack_packer_init(&packer, buffer, msgpack_sbuffer_write);
        msgpack_pack_object(&packer, value->m_Unpacked.data);
        return buffer;
    }
    static void Read(Value& value, Bytes bytes) {
        if (msgpack_unpack_next(&value.m_Unpacked, bytes->data, bytes->size, nullptr) !=
            MSGPACK_UNPACK_SUCCESS) {
            abort();
        }
    }
    static void Free(Bytes bytes) { msgpack_sbuffer_free(bytes); }

    // Texts of a value point into the bytes that it was read from.
    static inline std::vector<std::unique_ptr<msgpack_sbuffer, decltype(&msgpack_sbuffer_free)>>
        s_Kept;
};
#endif

using Clock = std::chrono::steady_clock;

void SetTime(benchmark::State& state, Clock::time_point started) {
    benchmark::ClobberMemory();
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - started).count());
}

// As many tables at a time as stay in the cache, so that the clock is read rarely.
size_t RoundsOf(int count) {
    return static_cast<size_t>(std::max(1, 1000 / count));
}

template <class Library>
void Write(benchmark::State& state, Content content, int count) {
    const auto value = Library::Make(content, count);
    const size_t rounds = RoundsOf(count);
    std::vector<typename Library::Bytes> written(rounds);
    while (state.KeepRunningBatch(
        static_cast<benchmark::IterationCount>(rounds * static_cast<size_t>(count)))) {
        auto started = Clock::now();
        for (auto& bytes : written) bytes = Library::Write(value);
        SetTime(state, started);
        for (auto& bytes : written) Library::Free(bytes);
    }
}

template <class Library>
void Read(benchmark::State& state, Content content, int count) {
    typename Library::Bytes bytes = Library::Write(Library::Make(content, count));
    const size_t rounds = RoundsOf(count);
    while (state.KeepRunningBatch(
        static_cast<benchmark::IterationCount>(rounds * static_cast<size_t>(count)))) {
        std::unique_ptr<typename Library::Value[]> values(new typename Library::Value[rounds]);
        auto started = Clock::now();
        for (size_t i = 0; i < rounds; i++) Library::Read(values[i], bytes);
        SetTime(state, started);
    }
    Library::Free(bytes);
}

template <class Library>
void Add(const char* variant, Content content, int count) {
    const char* kind = content == Content::Numbers ? " numbers@" : " attributes@";
    auto add = [&](const char* phase, void (*body)(benchmark::State&, Content, int)) {
        std::string name = std::string(phase) + std::to_string(count) + kind + variant;
        benchmark::RegisterBenchmark(name.c_str(), body, content, count)->UseManualTime();
    };
    add("write ", Write<Library>);
    add("read ", Read<Library>);
}

}  // namespace

int main(int argc, char** argv) {
    for (Content content : {Content::Numbers, Content::Attributes}) {
        for (int count : {3, 30, 1000, 100'000}) {
            if (content == Content::Attributes && count > 1000) continue;
            Add<Own>("ScriptVal", content, count);
            Add<Nlohmann>("nlohmann CBOR", content, count);
#ifdef KORVEL_MSGPACK
            Add<MessagePack>("msgpack-c", content, count);
#endif
        }
    }
    return Korvel::Bench::RunComparison(argc, argv);
}
